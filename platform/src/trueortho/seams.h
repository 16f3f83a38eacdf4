// Seamlines: the choice of one scene per mosaic pixel by regions, as the minimum of a cost made
// of a data term per scene and pixel and a seam term between neighbouring pixels that take
// different scenes.
#pragma once

#include <kestrel/export.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <limits>
#include <vector>

namespace kestrel {
namespace processes {
namespace trueortho {

class RunControl;

constexpr float kForbidden = std::numeric_limits<float>::infinity();

// A window of the mosaic grid, at full or reduced resolution, as the seam solver sees it. Arrays
// hold one value per cell, line after line.
struct SeamWindow {
    int width = 0, height = 0;
    // The scenes that may take cells here (indices into the recovery job's scenes) and, for
    // each of them, per cell:
    std::vector<std::size_t> scenes;
    // the data cost (>= 0; kForbidden where the scene does not see the ground), of the order of
    // 1 (e.g. the tangent of the view's angle off the vertical, more near occlusion edges); per
    // full-resolution pixel also in a reduced window (the mean over the cell's pixels), and
    std::vector<std::vector<float>> cost;
    // the scene's brightness after balancing, for the colour-disagreement part of the seam term
    // (grey levels; not read where the scene's cost is kForbidden). Empty: no colour term.
    std::vector<std::vector<float>> grey;
    // Metres the surface stands above the ground (0 where unknown); empty: all 0.
    std::vector<float> raised;
    // The index into `scenes` a cell must take, or -1 where it is free; empty: all free.
    std::vector<int> fixed;
};

// The seam term between two neighbouring cells labelled with different scenes a and b is
//   (seamWeight + raisedWeight * min(raised_p, raised_q)
//    + colourWeight * (|grey_a(p) - grey_b(p)| + |grey_a(q) - grey_b(q)|)) / pixelSize,
// so that the weights are costs per metre of seam against data costs per square metre: a
// survey at 0.1 m and one at 0.5 m put their seams in the same places. The raised part takes
// the lower side of the pair: a seam along a raised object's outline (ground on one side) is
// as cheap as on open ground, one over the object costs its height. (The recovery hands the
// solver raised heights widened by the surface's pixel error, so that such seams keep that far
// off the object's outline in the surface model.)
struct SeamParams {
    double pixelSize = 1.0;      // metres per full-resolution pixel
    float seamWeight = 0.5f;     // per metre of seam on open ground
    float raisedWeight = 2.0f;   // added per metre the surface stands above the ground
    float colourWeight = 0.05f;  // added per grey level the two scenes disagree (on each side)
    int tile = 256;              // cells per side of the windows read and solved (>= 16)
};

// The labels of a window: per cell an index into window.scenes, -1 where every cost is
// kForbidden. Never a scene whose cost is kForbidden while another is allowed; fixed cells keep
// their label.
KESTREL_API std::vector<int> SolveSeams(const SeamWindow& window, const SeamParams& params);

// The energy SolveSeams minimises: data costs of the free cells plus the seam terms.
KESTREL_API double SeamEnergy(const SeamWindow& window, const SeamParams& params,
                              const std::vector<int>& labels);

// The reduction factor of ChooseRegions' coarse pass over a grid of pixels x lines of
// pixelSize metres.
KESTREL_API int CoarseFactor(unsigned int pixels, unsigned int lines, double pixelSize);

// Per cell of a window, nonzero where the solver needs the cell in full: its costs, brightness
// and raised height. Given the window's scenes and, per scene and cell, a cost of 0 where the
// scene may take the cell and kForbidden where not (no grey, no raised heights).
using CellsNeeded = std::function<std::vector<std::uint8_t>(const SeamWindow& allowed)>;

// What the region chooser reads: a window of the mosaic grid in which each cell stands for
// factor x factor pixels (factor 1: full resolution); x0, y0, width and height count such cells
// (cell (i, j) covers pixels [i factor, (i + 1) factor) x [j factor, (j + 1) factor), clipped
// to the grid). At most params.tile + 2 cells on a side. May be called from several threads.
class SeamSource {
  public:
    virtual ~SeamSource() = default;
    virtual SeamWindow Read(int x0, int y0, int width, int height, int factor) = 0;
    // The same window, in full only where `needed` asks: the scenes are those Read gives and
    // each cost is allowed (< kForbidden) exactly where Read's is, but a cell that `needed`
    // leaves out may hold a cost of 0 for every allowed scene, and grey and raised values of 0.
    // A source may read more than is asked; by default it reads the whole window.
    virtual SeamWindow Read(int x0, int y0, int width, int height, int factor,
                            const CellsNeeded& needed) {
        (void)needed;
        return Read(x0, y0, width, height, factor);
    }
};

// Receives labels (1 + scene index, 0 where no scene sees the pixel) of a full-resolution
// window, line after line; called for windows that tile the grid, one call at a time.
using LabelSink =
    std::function<void(int x0, int y0, int width, int height, const std::vector<std::uint16_t>&)>;

// Chooses the regions over a grid of pixels x lines and hands them to `sink`, with memory
// bounded independently of the grid's size.
KESTREL_API void ChooseRegions(SeamSource& source, unsigned int pixels, unsigned int lines,
                               const SeamParams& params, unsigned int threads, RunControl& control,
                               const LabelSink& sink);

// The highest (or lowest) value within a square of side 2 radius + 1 cells around each cell, in
// place; O(1) per cell whatever the radius.
KESTREL_API void SquareFilter(std::vector<float>& grid, int width, int height, int radius,
                              bool highest);

// Metres the surface stands above the ground under it, from surface heights alone: the heights
// minus their morphological opening with a square of side 2 radius + 1 cells. NaN is no height
// (0 out).
KESTREL_API std::vector<float> RaisedHeights(const std::vector<float>& heights, int width,
                                             int height, int radius);

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
