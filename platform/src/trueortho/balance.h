// Colour balancing: per scene and channel a gain (and offset) that makes overlapping scenes
// agree where both see the ground.
#pragma once

#include <kestrel/export.h>

#include <cstddef>
#include <vector>

namespace kestrel {
namespace processes {
namespace trueortho {

enum class BalanceMode { None, Gain, GainOffset };

// Pixels that scenes a and b both see clearly: `bands` values per sample, interleaved.
struct OverlapSamples {
    std::size_t a = 0, b = 0;
    std::vector<float> valuesA, valuesB;
};

// Per scene and channel: corrected = gain * value + offset.
struct BalanceFit {
    std::vector<std::vector<double>> gain, offset;
};

// The fit for `scenes` scenes of `bands` channels; identity for BalanceMode::None and for
// scenes without samples.
KESTREL_API BalanceFit FitBalance(std::size_t scenes, int bands,
                                  const std::vector<OverlapSamples>& overlaps, BalanceMode mode);

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
