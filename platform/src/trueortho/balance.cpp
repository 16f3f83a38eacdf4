// Colour balancing. For now the identity.
#include "balance.h"

namespace kestrel {
namespace processes {
namespace trueortho {

BalanceFit FitBalance(std::size_t scenes, int bands, const std::vector<OverlapSamples>&,
                      BalanceMode) {
    BalanceFit fit;
    fit.gain.assign(scenes, std::vector<double>(bands, 1.0));
    fit.offset.assign(scenes, std::vector<double>(bands, 0.0));
    return fit;
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
