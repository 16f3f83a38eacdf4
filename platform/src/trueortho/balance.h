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

struct BalanceParams {
    // Huber's threshold in grey levels: a sample whose two corrected values differ by more
    // weighs threshold / difference, so that moved cars and misplaced edges pull little.
    double huberThreshold = 2.0;
    // The pull toward gain 1 and offset 0, in samples: per scene, this share of its samples
    // plus priorSamples, at the scene's mean plus and minus the spread of the values.
    double priorShare = 1e-4, priorSamples = 1.0;
    int iterations = 50;
    // Groups of overlapping scenes up to this size are solved directly (dense normal
    // equations), larger ones by conjugate gradients.
    std::size_t denseLimit = 100;
};

// The fit for `scenes` scenes of `bands` channels; identity for BalanceMode::None and for
// scenes without samples. Each group of scenes joined by overlaps keeps the mean of its samples
// (and, with offsets, a mean gain of 1). Non-finite sample values are left out. Throws
// DataException for an overlap that names a scene beyond `scenes` or whose value counts do not
// match.
KESTREL_API BalanceFit FitBalance(std::size_t scenes, int bands,
                                  const std::vector<OverlapSamples>& overlaps, BalanceMode mode,
                                  const BalanceParams& params = BalanceParams());

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
