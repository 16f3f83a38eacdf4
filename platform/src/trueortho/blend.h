// Blending across seams: each mosaic pixel a weighted mean of the scenes whose regions lie
// within the blend band, weights falling to zero where a scene does not see the ground.
#pragma once

#include <kestrel/export.h>

#include <cstddef>
#include <vector>

namespace kestrel {
namespace processes {
namespace trueortho {

enum class BlendMode { Feather, Multiband };

// A tile of the mosaic with a border of `border` pixels on each side (width and height
// include it). Arrays line after line.
struct BlendTile {
    int width = 0, height = 0, border = 0, bands = 0;
    // The inner tile's first pixel and line on the mosaic grid. Multiband blending aligns its
    // pyramid to the grid with it, so that neighbouring tiles agree.
    int x0 = 0, y0 = 0;
    std::vector<std::size_t> scenes;  // the scenes present (indices into the job's scenes)
    // Per scene: `bands` planes of width x height values (balanced); only read where seen.
    std::vector<std::vector<float>> values;
    // Per scene: 1 where the scene sees the ground and may weigh in the blend. Where the
    // region's own scene does not, the pixel takes the other scenes' blend within reach, else
    // still its region's value.
    std::vector<std::vector<unsigned char>> seen;
    // Per pixel: the index into `scenes` of the region the pixel belongs to, or -1 for none.
    std::vector<int> labels;
};

// The border a tile needs for a blend of `blendWidth` pixels: with it, a pixel's result does
// not depend on the tiling (exactly for feather, within a hundredth of the scenes' value range
// for multiband).
KESTREL_API int BlendBorder(BlendMode mode, int blendWidth);

// Whether BlendRegions gives every pixel its region's value (hard seams) in a tile whose regions
// belong to `scenes` scenes.
KESTREL_API bool HardSeamsOnly(BlendMode mode, int blendWidth, std::size_t scenes);

// The blended inner tile ((width - 2 border) x (height - 2 border), `bands` planes) into out;
// pixels whose label is -1 take noData. blendWidth 0: every pixel its region's value. Throws
// DataException for a negative width or arrays that do not match the tile's size.
KESTREL_API void BlendRegions(const BlendTile& tile, BlendMode mode, int blendWidth, float noData,
                              std::vector<float>& out);

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
