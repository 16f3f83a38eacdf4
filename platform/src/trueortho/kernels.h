// Resampling kernels of the generators, with GDAL's names and GDAL's weights: an image value at
// a continuous image position from a window of the source held in memory.
#pragma once

#include <string>
#include <vector>

namespace kestrel {
namespace processes {
namespace trueortho {

enum class Kernel { Near, Bilinear, Cubic };

// The kernel of a GDAL method name (any letter case); throws ParameterException (type 1) with
// the known names for another.
Kernel KernelByName(const std::string& name);
// Source pixels needed on each side of a position.
int KernelRadius(Kernel kernel);

// A window of source pixels, band after band, with the image's size for the edges.
struct SourceWindow {
    int x0 = 0, y0 = 0, width = 0, height = 0;
    int imageWidth = 0, imageHeight = 0;
    int bands = 0;
    std::vector<float> values;
    std::vector<char> hasNoData;
    std::vector<float> noData;
    bool anyNoData = false;  // whether any band has a no-data value
};

// Values of every band at (col, row): false where the position is outside the image or only
// no-data pixels contribute. No-data pixels and pixels outside the image are left out and the
// remaining weights renormalised, as GDAL's warper does.
bool Sample(const SourceWindow& window, Kernel kernel, double col, double row, float* out);

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
