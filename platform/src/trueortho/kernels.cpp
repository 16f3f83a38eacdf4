#include "kernels.h"

#include <kestrel/exception.h>

#include <algorithm>
#include <cctype>
#include <cmath>

namespace kestrel {
namespace processes {
namespace trueortho {

Kernel KernelByName(const std::string& name) {
    std::string lower(name);
    std::transform(lower.begin(), lower.end(), lower.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    if (lower == "near" || lower == "nearest")
        return Kernel::Near;
    if (lower == "bilinear")
        return Kernel::Bilinear;
    if (lower == "cubic")
        return Kernel::Cubic;
    KESTREL_THROW(ParameterException, name, ParameterException::Type(1), name,
                  "near, bilinear, cubic",
                  FormatString("Resampling method \"%s\" is not supported by the true-ortho "
                               "generator: use near, bilinear or cubic",
                               name.c_str()));
}

int KernelRadius(Kernel kernel) {
    return kernel == Kernel::Near ? 1 : kernel == Kernel::Bilinear ? 1 : 2;
}

namespace {

// Keys' cubic convolution with a = -0.5, GDAL's "cubic".
double CubicWeight(double x) {
    x = std::fabs(x);
    if (x < 1)
        return (1.5 * x - 2.5) * x * x + 1;
    if (x < 2)
        return ((-0.5 * x + 2.5) * x - 4) * x + 2;
    return 0;
}

// Weighted sum over a block of source pixels; weights wx (size nx) from column i0, wy from
// line j0.
bool Weighted(const SourceWindow& w, int i0, int j0, const double* wx, int nx, const double* wy,
              int ny, float* out) {
    const size_t bandSize = static_cast<size_t>(w.width) * w.height;
    // The usual case: the block inside the window (which lies inside the image) and no no-data
    // value to look for. One set of weights serves every band.
    if (!w.anyNoData && i0 >= w.x0 && j0 >= w.y0 && i0 + nx <= w.x0 + w.width &&
        j0 + ny <= w.y0 + w.height && i0 >= 0 && j0 >= 0 && i0 + nx <= w.imageWidth &&
        j0 + ny <= w.imageHeight) {
        double weight = 0, wxSum = 0;
        for (int di = 0; di < nx; ++di)
            wxSum += wx[di];
        for (int dj = 0; dj < ny; ++dj)
            weight += wy[dj] * wxSum;
        if (std::fabs(weight) < 1e-5)
            return false;
        const size_t first = static_cast<size_t>(j0 - w.y0) * w.width + (i0 - w.x0);
        for (int b = 0; b < w.bands; ++b) {
            const float* pixel = w.values.data() + bandSize * b + first;
            double sum = 0;
            for (int dj = 0; dj < ny; ++dj, pixel += w.width) {
                double line = 0;
                for (int di = 0; di < nx; ++di)
                    line += wx[di] * pixel[di];
                sum += wy[dj] * line;
            }
            out[b] = static_cast<float>(sum / weight);
        }
        return true;
    }
    for (int b = 0; b < w.bands; ++b) {
        const float* band = w.values.data() + bandSize * b;
        double sum = 0, weight = 0;
        for (int dj = 0; dj < ny; ++dj) {
            const int j = j0 + dj;
            // Outside the image, or (never for a window read with the kernel's radius) outside
            // the window: left out.
            if (j < 0 || j >= w.imageHeight || j < w.y0 || j >= w.y0 + w.height || wy[dj] == 0)
                continue;
            const float* line = band + static_cast<size_t>(j - w.y0) * w.width;
            for (int di = 0; di < nx; ++di) {
                const int i = i0 + di;
                if (i < 0 || i >= w.imageWidth || i < w.x0 || i >= w.x0 + w.width || wx[di] == 0)
                    continue;
                const float v = line[i - w.x0];
                if (w.hasNoData[b] && v == w.noData[b])
                    continue;
                sum += wx[di] * wy[dj] * v;
                weight += wx[di] * wy[dj];
            }
        }
        if (std::fabs(weight) < 1e-5)
            return false;
        out[b] = static_cast<float>(sum / weight);
    }
    return true;
}

// Whether every band holds its no-data value at a source pixel: such a pixel is no image.
bool IsNoData(const SourceWindow& w, int i, int j) {
    if (i < w.x0 || j < w.y0 || i >= w.x0 + w.width || j >= w.y0 + w.height)
        return true;
    const size_t bandSize = static_cast<size_t>(w.width) * w.height;
    const size_t k = static_cast<size_t>(j - w.y0) * w.width + static_cast<size_t>(i - w.x0);
    for (int b = 0; b < w.bands; ++b)
        if (!w.hasNoData[b] || w.values[bandSize * b + k] != w.noData[b])
            return false;
    return true;
}

}  // namespace

bool Sample(const SourceWindow& w, Kernel kernel, double col, double row, float* out) {
    if (!(col >= 0 && row >= 0 && col < w.imageWidth && row < w.imageHeight))
        return false;
    // As in GDAL's warper, a position over a no-data pixel has no value, whatever its
    // neighbours hold.
    if (IsNoData(w, static_cast<int>(col), static_cast<int>(row)))
        return false;
    if (kernel == Kernel::Near) {
        const double one = 1.0;
        return Weighted(w, static_cast<int>(col), static_cast<int>(row), &one, 1, &one, 1, out);
    }
    const double fx = col - 0.5, fy = row - 0.5;
    const int i = static_cast<int>(std::floor(fx)), j = static_cast<int>(std::floor(fy));
    const double ax = fx - i, ay = fy - j;
    if (kernel == Kernel::Bilinear) {
        const double wx[2] = {1 - ax, ax}, wy[2] = {1 - ay, ay};
        return Weighted(w, i, j, wx, 2, wy, 2, out);
    }
    const double wx[4] = {CubicWeight(ax + 1), CubicWeight(ax), CubicWeight(1 - ax),
                          CubicWeight(2 - ax)};
    const double wy[4] = {CubicWeight(ay + 1), CubicWeight(ay), CubicWeight(1 - ay),
                          CubicWeight(2 - ay)};
    return Weighted(w, i - 1, j - 1, wx, 4, wy, 4, out);
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
