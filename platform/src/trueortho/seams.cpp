// Seamlines. For now each cell takes its cheapest scene.
#include "seams.h"

#include "runcontrol.h"

#include <algorithm>
#include <cmath>

namespace kestrel {
namespace processes {
namespace trueortho {

std::vector<int> SolveSeams(const SeamWindow& window, const SeamParams&) {
    const std::size_t cells = static_cast<std::size_t>(window.width) * window.height;
    std::vector<int> labels(cells, -1);
    for (std::size_t c = 0; c < cells; ++c) {
        if (!window.fixed.empty() && window.fixed[c] >= 0) {
            labels[c] = window.fixed[c];
            continue;
        }
        float best = kForbidden;
        for (std::size_t k = 0; k < window.scenes.size(); ++k)
            if (window.cost[k][c] < best)
                best = window.cost[k][c], labels[c] = static_cast<int>(k);
    }
    return labels;
}

void ChooseRegions(SeamSource& source, unsigned int pixels, unsigned int lines,
                   const SeamParams& params, unsigned int, RunControl& control,
                   const LabelSink& sink) {
    constexpr unsigned int kTile = 512;
    for (unsigned int y = 0; y < lines && !control.Stopped(); y += kTile)
        for (unsigned int x = 0; x < pixels && !control.Stopped(); x += kTile) {
            const int w = static_cast<int>(std::min(kTile, pixels - x));
            const int h = static_cast<int>(std::min(kTile, lines - y));
            const SeamWindow window = source.Read(static_cast<int>(x), static_cast<int>(y), w, h, 1);
            const std::vector<int> labels = SolveSeams(window, params);
            std::vector<std::uint16_t> out(labels.size());
            for (std::size_t c = 0; c < labels.size(); ++c)
                out[c] = labels[c] < 0
                             ? 0
                             : static_cast<std::uint16_t>(window.scenes[labels[c]] + 1);
            sink(static_cast<int>(x), static_cast<int>(y), w, h, out);
        }
}

std::vector<float> RaisedHeights(const std::vector<float>& heights, int width, int height,
                                 int radius) {
    // Separable minimum then maximum over the square (an opening).
    auto pass = [&](const std::vector<float>& in, bool takeMin, bool alongRows) {
        std::vector<float> out(in.size());
        for (int y = 0; y < height; ++y)
            for (int x = 0; x < width; ++x) {
                float v = takeMin ? INFINITY : -INFINITY;
                for (int d = -radius; d <= radius; ++d) {
                    const int xx = alongRows ? x + d : x, yy = alongRows ? y : y + d;
                    if (xx < 0 || yy < 0 || xx >= width || yy >= height)
                        continue;
                    const float h = in[static_cast<std::size_t>(yy) * width + xx];
                    if (std::isnan(h))
                        continue;
                    v = takeMin ? std::min(v, h) : std::max(v, h);
                }
                out[static_cast<std::size_t>(y) * width + x] = v;
            }
        return out;
    };
    const std::vector<float> opened =
        pass(pass(pass(pass(heights, true, true), true, false), false, true), false, false);
    std::vector<float> raised(heights.size(), 0.0f);
    for (std::size_t c = 0; c < heights.size(); ++c)
        if (std::isfinite(heights[c]) && std::isfinite(opened[c]))
            raised[c] = std::max(0.0f, heights[c] - opened[c]);
    return raised;
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
