// The resampling kernels of GDAL's warper, in GDAL's unnormalised form: every sum of weights is
// divided by its total, so constant factors do not matter.
#pragma once

#include <cmath>

namespace kestrel {
namespace utils {
namespace kernels {

constexpr double kPi = 3.14159265358979323846;

inline double Bilinear(double x) {
    const double a = std::fabs(x);
    return a <= 1.0 ? 1.0 - a : 0.0;
}

// Keys' cubic convolution with a = -0.5 (Catmull-Rom).
inline double Cubic(double x) {
    const double a = std::fabs(x);
    if (a <= 1.0)
        return (1.5 * a - 2.5) * a * a + 1.0;
    if (a <= 2.0)
        return ((-0.5 * a + 2.5) * a - 4.0) * a + 2.0;
    return 0.0;
}

// Cubic B-spline (times 6).
inline double BSpline(double x) {
    const double a = std::fabs(x);
    if (a < 1.0)
        return 4.0 - 6.0 * a * a + 3.0 * a * a * a;
    if (a < 2.0) {
        const double b = 2.0 - a;
        return b * b * b;
    }
    return 0.0;
}

// Lanczos windowed sinc with 3 lobes.
inline double Lanczos(double x) {
    if (x == 0.0)
        return 1.0;
    if (std::fabs(x) >= 3.0)
        return 0.0;
    const double pix = kPi * x;
    const double pixOver3 = pix / 3.0;
    return std::sin(pix) * std::sin(pixOver3) / (pix * pixOver3);
}

// One value of Catmull-Rom interpolation between p1 and p2 at distance t from p1, as GDAL's
// 4-sample cubic computes it.
inline double CubicConvolve(double t, double p0, double p1, double p2, double p3) {
    return p1 + 0.5 * t *
                    (p2 - p0 +
                     t * (2.0 * p0 - 5.0 * p1 + 4.0 * p2 - p3 + t * (3.0 * (p1 - p2) + p3 - p0)));
}

}  // namespace kernels
}  // namespace utils
}  // namespace kestrel
