#include "zbuffer.h"

#include <algorithm>
#include <cmath>
#include <limits>

namespace kestrel {
namespace processes {
namespace trueortho {

namespace {
constexpr float kEmpty = -std::numeric_limits<float>::infinity();
}

void ZBuffer::Reset(int x0, int y0, int width, int height) {
    x0_ = x0, y0_ = y0, width_ = std::max(width, 0), height_ = std::max(height, 0);
    z_.assign(static_cast<size_t>(width_) * height_, kEmpty);
    slope_.assign(z_.size(), 0.0f);
}

void ZBuffer::AddTriangle(const double* col, const double* row, const double* height) {
    const double area =
        (col[1] - col[0]) * (row[2] - row[0]) - (col[2] - col[0]) * (row[1] - row[0]);
    if (!(std::fabs(area) > 1e-12))
        return;  // seen edge-on (or not finite): covers no pixel centre
    // Pixel centres i + 0.5 within the triangle's bounds and the buffer.
    const double minC = std::min({col[0], col[1], col[2]}),
                 maxC = std::max({col[0], col[1], col[2]});
    const double minR = std::min({row[0], row[1], row[2]}),
                 maxR = std::max({row[0], row[1], row[2]});
    const int i0 = std::max(static_cast<int>(std::ceil(minC - 0.5)), x0_);
    const int i1 = std::min(static_cast<int>(std::floor(maxC - 0.5)), x0_ + width_ - 1);
    const int j0 = std::max(static_cast<int>(std::ceil(minR - 0.5)), y0_);
    const int j1 = std::min(static_cast<int>(std::floor(maxR - 0.5)), y0_ + height_ - 1);
    if (i0 > i1 || j0 > j1)
        return;
    const double inv = 1.0 / area;
    // Height as a function of the image position: its gradient.
    const double dzdc = ((height[1] - height[0]) * (row[2] - row[0]) -
                         (height[2] - height[0]) * (row[1] - row[0])) *
                        inv;
    const double dzdr = ((col[1] - col[0]) * (height[2] - height[0]) -
                         (col[2] - col[0]) * (height[1] - height[0])) *
                        inv;
    const float slope = static_cast<float>(std::hypot(dzdc, dzdr));
    // A small allowance so that centres on a shared edge are covered by at least one triangle.
    const double eps = -1e-9;
    for (int j = j0; j <= j1; ++j) {
        const double r = j + 0.5;
        const size_t line = static_cast<size_t>(j - y0_) * width_;
        for (int i = i0; i <= i1; ++i) {
            const double c = i + 0.5;
            const double w0 = ((col[1] - c) * (row[2] - r) - (col[2] - c) * (row[1] - r)) * inv;
            const double w1 = ((col[2] - c) * (row[0] - r) - (col[0] - c) * (row[2] - r)) * inv;
            const double w2 = 1.0 - w0 - w1;
            if (w0 < eps || w1 < eps || w2 < eps)
                continue;
            const float z = static_cast<float>(w0 * height[0] + w1 * height[1] + w2 * height[2]);
            const size_t k = line + static_cast<size_t>(i - x0_);
            if (z > z_[k])
                z_[k] = z, slope_[k] = slope;
        }
    }
}

float ZBuffer::SurfaceBound(double col, double row) const {
    const int i = static_cast<int>(std::floor(col)), j = static_cast<int>(std::floor(row));
    if (i < x0_ || j < y0_ || i >= x0_ + width_ || j >= y0_ + height_)
        return kEmpty;
    const size_t k = static_cast<size_t>(j - y0_) * width_ + (i - x0_);
    const double distance = std::hypot(col - (i + 0.5), row - (j + 0.5));
    return static_cast<float>(z_[k] - slope_[k] * distance);
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
