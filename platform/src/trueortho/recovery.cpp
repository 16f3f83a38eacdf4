#include <kestrel/exception.h>
#include <kestrel/trueortho.h>

namespace kestrel {
namespace processes {

TorthoRecoveryResult OcclusionRecovery::Recover(const RecoveryJob&) {
    KESTREL_THROW(DataException, "not yet");
}

}  // namespace processes
}  // namespace kestrel
