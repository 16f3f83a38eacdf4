// Blending across seams. For now every pixel takes its region's value.
#include "blend.h"

namespace kestrel {
namespace processes {
namespace trueortho {

int BlendBorder(BlendMode, int blendWidth) { return blendWidth; }

void BlendRegions(const BlendTile& tile, BlendMode, int, float noData, std::vector<float>& out) {
    const int b = tile.border, w = tile.width - 2 * b, h = tile.height - 2 * b;
    const std::size_t plane = static_cast<std::size_t>(w) * h;
    const std::size_t full = static_cast<std::size_t>(tile.width) * tile.height;
    out.assign(plane * tile.bands, noData);
    for (int j = 0; j < h; ++j)
        for (int i = 0; i < w; ++i) {
            const std::size_t p = static_cast<std::size_t>(j + b) * tile.width + i + b;
            const int label = tile.labels[p];
            if (label < 0)
                continue;
            for (int band = 0; band < tile.bands; ++band)
                out[plane * band + static_cast<std::size_t>(j) * w + i] =
                    tile.values[label][full * band + p];
        }
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
