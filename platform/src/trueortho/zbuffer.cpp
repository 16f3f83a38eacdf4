#include "zbuffer.h"

#include <algorithm>
#include <cmath>
#include <limits>

namespace kestrel {
namespace processes {
namespace trueortho {

namespace {
constexpr float kEmpty = -std::numeric_limits<float>::infinity();

// floor and ceil of a finite value within int's range, without a library call.
inline int Floor(double v) {
    const int i = static_cast<int>(v);
    return i - (v < i);
}
inline int Ceil(double v) {
    const int i = static_cast<int>(v);
    return i + (v > i);
}
}  // namespace

void ZBuffer::Reset(int x0, int y0, int width, int height) {
    x0_ = x0, y0_ = y0, width_ = std::max(width, 0), height_ = std::max(height, 0);
    z_.assign(static_cast<size_t>(width_) * height_, kEmpty);
    slope_.assign(z_.size(), 0.0f);
}

void ZBuffer::AddTriangle(const double* col, const double* row, const double* height) {
    // Pixel centres i + 0.5 within the triangle's bounds and the buffer; most triangles are
    // about a pixel across and hold one centre or none, so this test comes first.
    const double minC = std::min({col[0], col[1], col[2]}),
                 maxC = std::max({col[0], col[1], col[2]});
    const double minR = std::min({row[0], row[1], row[2]}),
                 maxR = std::max({row[0], row[1], row[2]});
    if (!(minC < x0_ + width_ && maxC > x0_ && minR < y0_ + height_ && maxR > y0_))
        return;  // also for positions that are not finite
    // Clamped to the buffer (before the conversions, which then stay within int's range).
    const int i0 = std::max(Ceil(std::max(minC, x0_ - 1.0) - 0.5), x0_);
    const int i1 = std::min(Floor(std::min(maxC, x0_ + width_ + 1.0) - 0.5), x0_ + width_ - 1);
    const int j0 = std::max(Ceil(std::max(minR, y0_ - 1.0) - 0.5), y0_);
    const int j1 = std::min(Floor(std::min(maxR, y0_ + height_ + 1.0) - 0.5), y0_ + height_ - 1);
    if (i0 > i1 || j0 > j1)
        return;
    const double area =
        (col[1] - col[0]) * (row[2] - row[0]) - (col[2] - col[0]) * (row[1] - row[0]);
    if (!(std::fabs(area) > 1e-12))
        return;  // seen edge-on: covers no pixel centre
    const double inv = 1.0 / area;
    // Height as a function of the image position: its gradient.
    const double dzdc = ((height[1] - height[0]) * (row[2] - row[0]) -
                         (height[2] - height[0]) * (row[1] - row[0])) *
                        inv;
    const double dzdr = ((col[1] - col[0]) * (height[2] - height[0]) -
                         (col[2] - col[0]) * (height[1] - height[0])) *
                        inv;
    const float slope = static_cast<float>(std::sqrt(dzdc * dzdc + dzdr * dzdr));
    // Barycentric weights are affine in the position: their value at the first centre and
    // their steps along a line and down the lines.
    const double c0 = i0 + 0.5, r0 = j0 + 0.5;
    const double w0Start = ((col[1] - c0) * (row[2] - r0) - (col[2] - c0) * (row[1] - r0)) * inv;
    const double w1Start = ((col[2] - c0) * (row[0] - r0) - (col[0] - c0) * (row[2] - r0)) * inv;
    const double w0dc = (row[1] - row[2]) * inv, w0dr = (col[2] - col[1]) * inv;
    const double w1dc = (row[2] - row[0]) * inv, w1dr = (col[0] - col[2]) * inv;
    const double zStart = height[0] + dzdc * (c0 - col[0]) + dzdr * (r0 - row[0]);
    // A small allowance so that centres on a shared edge are covered by at least one triangle.
    const double eps = -1e-9;
    for (int j = j0; j <= j1; ++j) {
        const double dr = j - j0;
        const double w0Line = w0Start + w0dr * dr, w1Line = w1Start + w1dr * dr;
        const double zLine = zStart + dzdr * dr;
        float* z = z_.data() + static_cast<size_t>(j - y0_) * width_ + (i0 - x0_);
        float* s = slope_.data() + static_cast<size_t>(j - y0_) * width_ + (i0 - x0_);
        const int count = i1 - i0 + 1;
        for (int i = 0; i < count; ++i) {
            const double w0 = w0Line + w0dc * i, w1 = w1Line + w1dc * i;
            const double w2 = 1.0 - w0 - w1;
            const float value = static_cast<float>(zLine + dzdc * i);
            // Selected and stored unconditionally, so that the loop has no branch.
            const float kept = z[i], keptSlope = s[i];
            const bool higher = (w0 >= eps) & (w1 >= eps) & (w2 >= eps) & (value > kept);
            z[i] = higher ? value : kept;
            s[i] = higher ? slope : keptSlope;
        }
    }
}

float ZBuffer::SurfaceBound(double col, double row) const {
    const int i = static_cast<int>(std::floor(col)), j = static_cast<int>(std::floor(row));
    if (i < x0_ || j < y0_ || i >= x0_ + width_ || j >= y0_ + height_)
        return kEmpty;
    const size_t k = static_cast<size_t>(j - y0_) * width_ + (i - x0_);
    const double dc = col - (i + 0.5), dr = row - (j + 0.5);
    return static_cast<float>(z_[k] - slope_[k] * std::sqrt(dc * dc + dr * dr));
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
