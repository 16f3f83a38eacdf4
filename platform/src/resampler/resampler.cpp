#include <kestrel/resampler.h>

#include <algorithm>
#include <cctype>
#include <cmath>
#include <cstdint>
#include <limits>
#include <memory>
#include <vector>

#include <kestrel/exception.h>

#include "kernels.h"

namespace kestrel {
namespace utils {

IRasterResampler::~IRasterResampler() = default;

namespace {

using datasources::DataType;

constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();

enum class Method { Near, Bilinear, Cubic, CubicSpline, Lanczos, Average, Mode };

struct MethodName {
    const char* name;
    Method method;
};

const MethodName kMethods[] = {
    {"near", Method::Near},       {"bilinear", Method::Bilinear},
    {"cubic", Method::Cubic},     {"cubicspline", Method::CubicSpline},
    {"lanczos", Method::Lanczos}, {"average", Method::Average},
    {"mode", Method::Mode},
};

// GDAL's scale for a step: the ratio of output to source pixel size, at most 1, snapped to the
// reciprocal of a whole number when it is within 0.05 of one.
double ScaleOfStep(double step) {
    double scale = 1.0 / step;
    if (scale < 1.0) {
        const double reciprocal = step;
        const double whole = std::floor(reciprocal + 0.5);
        if (std::fabs(reciprocal - whole) < 0.05)
            scale = 1.0 / whole;
    }
    return std::min(scale, 1.0);
}

// A pixel's value is missing when it is NaN or equals the channel's no-data value.
struct Validity {
    bool hasNoData = false;
    double noData = 0.0;
    bool IsValid(double v) const { return !std::isnan(v) && !(hasNoData && v == noData); }
    // Whether any value of the type can be missing (integers are never NaN).
    template <typename T>
    bool Possible() const {
        return hasNoData || !std::numeric_limits<T>::is_integer;
    }
};

// The window of one channel as the kernels see it.
template <typename T>
struct Plane {
    const T* data;
    int width;
    int height;
    double x0;  // the window's origin in the image
    double y0;
    T At(int x, int y) const { return data[static_cast<std::ptrdiff_t>(y) * width + x]; }
};

// Weights of a separable interpolating kernel along one axis for one position.
struct AxisWeights {
    int first = 0;  // window index of the first tap
    int count = 0;
    std::vector<double> w;
    std::vector<double> normalised;  // w divided by its sum
};

// Normalises the weights when every tap lies inside [0, size); false otherwise (the general
// kernel then clips and renormalises).
inline bool Normalise(AxisWeights& axis, int size, std::vector<double>& out) {
    if (axis.first < 0 || axis.first + axis.count > size)
        return false;
    double sum = 0.0;
    for (int i = 0; i < axis.count; ++i)
        sum += axis.w[i];
    if (sum == 0.0)
        return false;
    out.resize(static_cast<std::size_t>(axis.count));
    const double inverse = 1.0 / sum;
    for (int i = 0; i < axis.count; ++i)
        out[i] = axis.w[i] * inverse;
    return true;
}

class Resampler : public IRasterResampler {
  public:
    explicit Resampler(Method method) : method_(method) { Configure(); }

    std::string GetMethod() const override {
        for (const auto& m : kMethods) {
            if (m.method == method_)
                return m.name;
        }
        return "";
    }

    void SetSourceStep(double stepX, double stepY) override {
        if (!std::isfinite(stepX) || !std::isfinite(stepY) || stepX <= 0.0 || stepY <= 0.0 ||
            stepX > 1000.0 || stepY > 1000.0) {
            KESTREL_THROW(DataException,
                          FormatString("Resampling step %g x %g: steps must be positive and at "
                                       "most 1000 source pixels",
                                       stepX, stepY));
        }
        stepX_ = stepX;
        stepY_ = stepY;
        Configure();
    }
    double GetSourceStepX() const override { return stepX_; }
    double GetSourceStepY() const override { return stepY_; }

    unsigned int GetRadius() const override {
        switch (method_) {
            case Method::Near:
                return 0;
            case Method::Average:
            case Method::Mode:
                return static_cast<unsigned int>(std::ceil(std::max(stepX_, stepY_) / 2.0)) + 1;
            default:
                return static_cast<unsigned int>(std::max(radiusX_, radiusY_));
        }
    }

    void Resample(const gobs::Raster& window, unsigned int c, std::size_t n, const double* x,
                  const double* y, double* values, const double* noData) const override {
        if (c >= window.GetChannelCount()) {
            KESTREL_THROW(DataException,
                          FormatString("Channel %u of a window of %u channels cannot be "
                                       "resampled",
                                       c, window.GetChannelCount()));
        }
        Run(window, c, 1, n, x, y, values, noData, false);
    }

    void ResampleAll(const gobs::Raster& window, std::size_t n, const double* x, const double* y,
                     double* values, const double* noData) const override {
        Run(window, 0, window.GetChannelCount(), n, x, y, values, noData, true);
    }

  private:
    void Configure() {
        switch (method_) {
            case Method::Bilinear:
                filterRadius_ = 1;
                break;
            case Method::Cubic:
                filterRadius_ = 2;
                break;
            case Method::CubicSpline:
                filterRadius_ = 2;
                break;
            case Method::Lanczos:
                filterRadius_ = 3;
                break;
            default:
                filterRadius_ = 0;
                break;
        }
        scaleX_ = ScaleOfStep(stepX_);
        scaleY_ = ScaleOfStep(stepY_);
        radiusX_ =
            scaleX_ < 1.0 ? static_cast<int>(std::ceil(filterRadius_ / scaleX_)) : filterRadius_;
        radiusY_ =
            scaleY_ < 1.0 ? static_cast<int>(std::ceil(filterRadius_ / scaleY_)) : filterRadius_;
        fourSamples_ = (method_ == Method::Bilinear || method_ == Method::Cubic) &&
                       scaleX_ >= 0.95 && scaleY_ >= 0.95;
        if (method_ == Method::Lanczos)
            BuildTable();
    }

    // Lanczos weights are looked up: sin is the costly part of the kernel.
    void BuildTable() {
        table_.resize(kTableSteps * 3 + 2);
        for (std::size_t i = 0; i < table_.size(); ++i)
            table_[i] = kernels::Lanczos(static_cast<double>(i) / kTableSteps);
    }
    double Lookup(double v) const {
        const double a = std::fabs(v) * kTableSteps;
        const std::size_t i = static_cast<std::size_t>(a);
        if (i + 1 >= table_.size())
            return 0.0;
        const double f = a - static_cast<double>(i);
        return table_[i] + (table_[i + 1] - table_[i]) * f;
    }

    template <typename K>
    static void Fill(AxisWeights& axis, int radius, double delta, double scale, K kernel) {
        for (int i = 0; i < axis.count; ++i)
            axis.w[i] = kernel((i + 1 - radius - delta) * scale);
    }

    void Weights(double pos, int radius, double scale, AxisWeights& axis) const {
        const double base = std::floor(pos - 0.5);
        const double delta = pos - 0.5 - base;
        axis.first = static_cast<int>(base) + 1 - radius;
        axis.count = 2 * radius;
        axis.w.resize(static_cast<std::size_t>(axis.count));
        switch (method_) {
            case Method::Bilinear:
                return Fill(axis, radius, delta, scale, kernels::Bilinear);
            case Method::Cubic:
                return Fill(axis, radius, delta, scale, kernels::Cubic);
            case Method::CubicSpline:
                return Fill(axis, radius, delta, scale, kernels::BSpline);
            default:
                return Fill(axis, radius, delta, scale, [this](double v) { return Lookup(v); });
        }
    }

    void Run(const gobs::Raster& window, unsigned int first, unsigned int count, std::size_t n,
             const double* x, const double* y, double* values, const double* noData,
             bool perChannelNoData) const {
        switch (window.GetDataType()) {
            case DataType::Byte:
                return RunTyped<std::uint8_t>(window, first, count, n, x, y, values, noData,
                                              perChannelNoData);
            case DataType::UInt16:
                return RunTyped<std::uint16_t>(window, first, count, n, x, y, values, noData,
                                               perChannelNoData);
            case DataType::Int16:
                return RunTyped<std::int16_t>(window, first, count, n, x, y, values, noData,
                                              perChannelNoData);
            case DataType::UInt32:
                return RunTyped<std::uint32_t>(window, first, count, n, x, y, values, noData,
                                               perChannelNoData);
            case DataType::Int32:
                return RunTyped<std::int32_t>(window, first, count, n, x, y, values, noData,
                                              perChannelNoData);
            case DataType::Float32:
                return RunTyped<float>(window, first, count, n, x, y, values, noData,
                                       perChannelNoData);
            case DataType::Float64:
            case DataType::Unknown:
                break;
        }
        RunTyped<double>(window, first, count, n, x, y, values, noData, perChannelNoData);
    }

    template <typename T>
    void RunTyped(const gobs::Raster& window, unsigned int first, unsigned int count, std::size_t n,
                  const double* x, const double* y, double* values, const double* noData,
                  bool perChannelNoData) const {
        std::vector<Plane<T>> planes;
        std::vector<Validity> validity;
        for (unsigned int c = first; c < first + count; ++c) {
            planes.push_back(
                {static_cast<const T*>(window.GetChannelData(c)),
                 static_cast<int>(window.GetWidth()), static_cast<int>(window.GetHeight()),
                 static_cast<double>(window.GetX()), static_cast<double>(window.GetY())});
            Validity v;
            if (noData != nullptr) {
                const double value = perChannelNoData ? noData[c - first] : *noData;
                v.hasNoData = !std::isnan(value);
                v.noData = value;
            }
            validity.push_back(v);
        }
        switch (method_) {
            case Method::Near:
                return Nearest(planes, validity, n, x, y, values);
            case Method::Average:
            case Method::Mode:
                return Area(planes, validity, n, x, y, values);
            default:
                return Interpolate(planes, validity, n, x, y, values);
        }
    }

    // The window index of the pixel that holds a position, or false when the position lies
    // outside the window (GDAL's test, with its tolerance for positions on the far edge).
    template <typename T>
    static bool PixelOf(const Plane<T>& p, double x, double y, int& ix, int& iy) {
        if (!(x >= p.x0 && y >= p.y0))  // also false for NaN
            return false;
        if (x + 1e-10 > p.x0 + p.width || y + 1e-10 > p.y0 + p.height)
            return false;
        ix = static_cast<int>(x + 1e-10 - p.x0);
        iy = static_cast<int>(y + 1e-10 - p.y0);
        return ix < p.width && iy < p.height;
    }

    template <typename T>
    void Nearest(const std::vector<Plane<T>>& planes, const std::vector<Validity>& validity,
                 std::size_t n, const double* x, const double* y, double* values) const {
        const Plane<T>& p0 = planes.front();
        for (std::size_t i = 0; i < n; ++i) {
            int ix = 0;
            int iy = 0;
            const bool inside = PixelOf(p0, x[i], y[i], ix, iy);
            for (std::size_t c = 0; c < planes.size(); ++c) {
                double v = kNaN;
                if (inside) {
                    v = static_cast<double>(planes[c].At(ix, iy));
                    if (!validity[c].IsValid(v))
                        v = kNaN;
                }
                values[c * n + i] = v;
            }
        }
    }

    // GDAL's 4-sample bilinear: the weights of the pixels that are inside and valid,
    // renormalised.
    template <typename T>
    static double Bilinear4(const Plane<T>& p, const Validity& valid, double sx, double sy) {
        const int ix = static_cast<int>(std::floor(sx - 0.5));
        const int iy = static_cast<int>(std::floor(sy - 0.5));
        const double rx = 1.5 - (sx - ix);
        const double ry = 1.5 - (sy - iy);
        if (ix >= 0 && ix + 1 < p.width && iy >= 0 && iy + 1 < p.height &&
            !valid.template Possible<T>()) {
            const double top = p.At(ix, iy) * rx + p.At(ix + 1, iy) * (1.0 - rx);
            const double bottom = p.At(ix, iy + 1) * rx + p.At(ix + 1, iy + 1) * (1.0 - rx);
            return top * ry + bottom * (1.0 - ry);
        }
        double sum = 0.0;
        double weight = 0.0;
        const double wx[2] = {rx, 1.0 - rx};
        const double wy[2] = {ry, 1.0 - ry};
        for (int j = 0; j < 2; ++j) {
            const int yy = iy + j;
            if (yy < 0 || yy >= p.height)
                continue;
            for (int k = 0; k < 2; ++k) {
                const int xx = ix + k;
                if (xx < 0 || xx >= p.width)
                    continue;
                const double v = p.At(xx, yy);
                if (!valid.IsValid(v))
                    continue;
                const double w = wx[k] * wy[j];
                sum += v * w;
                weight += w;
            }
        }
        if (weight < 0.00001)
            return kNaN;
        return weight == 1.0 ? sum : sum / weight;
    }

    // GDAL's 4-sample cubic: Catmull-Rom on the 4 x 4 pixels around the position, bilinear
    // where any of them is outside or missing.
    template <typename T>
    static double Cubic4(const Plane<T>& p, const Validity& valid, double sx, double sy) {
        const int ix = static_cast<int>(std::floor(sx - 0.5));
        const int iy = static_cast<int>(std::floor(sy - 0.5));
        if (ix - 1 < 0 || ix + 2 >= p.width || iy - 1 < 0 || iy + 2 >= p.height)
            return Bilinear4(p, valid, sx, sy);
        const double dx = sx - 0.5 - ix;
        const double dy = sy - 0.5 - iy;
        double rows[4];
        for (int j = 0; j < 4; ++j) {
            const T* row = p.data + static_cast<std::ptrdiff_t>(iy - 1 + j) * p.width + ix - 1;
            const double v0 = row[0];
            const double v1 = row[1];
            const double v2 = row[2];
            const double v3 = row[3];
            if (valid.template Possible<T>() &&
                !(valid.IsValid(v0) && valid.IsValid(v1) && valid.IsValid(v2) && valid.IsValid(v3)))
                return Bilinear4(p, valid, sx, sy);
            rows[j] = kernels::CubicConvolve(dx, v0, v1, v2, v3);
        }
        return kernels::CubicConvolve(dy, rows[0], rows[1], rows[2], rows[3]);
    }

    // GDAL's general separable kernel: taps from 1 - radius to radius around the pixel left of
    // and above the position, weights scaled when downsampling, clipped to the window and to
    // valid pixels, renormalised.
    template <typename T>
    static double Separable(const Plane<T>& p, const Validity& valid, const AxisWeights& ax,
                            const AxisWeights& ay) {
        const int x0 = std::max(ax.first, 0);
        const int x1 = std::min(ax.first + ax.count, p.width);
        const int y0 = std::max(ay.first, 0);
        const int y1 = std::min(ay.first + ay.count, p.height);
        if (x0 >= x1 || y0 >= y1)
            return kNaN;
        double sum = 0.0;
        if (!valid.template Possible<T>()) {
            double weightX = 0.0;
            for (int i = x0; i < x1; ++i)
                weightX += ax.w[i - ax.first];
            double weightY = 0.0;
            for (int j = y0; j < y1; ++j) {
                const T* row = p.data + static_cast<std::ptrdiff_t>(j) * p.width;
                double line = 0.0;
                for (int i = x0; i < x1; ++i)
                    line += row[i] * ax.w[i - ax.first];
                const double wy = ay.w[j - ay.first];
                sum += line * wy;
                weightY += wy;
            }
            const double weight = weightX * weightY;
            return weight == 0.0 ? kNaN : sum / weight;
        }
        double weight = 0.0;
        for (int j = y0; j < y1; ++j) {
            const T* row = p.data + static_cast<std::ptrdiff_t>(j) * p.width;
            const double wy = ay.w[j - ay.first];
            for (int i = x0; i < x1; ++i) {
                const double v = row[i];
                if (!valid.IsValid(v))
                    continue;
                const double w = ax.w[i - ax.first] * wy;
                sum += v * w;
                weight += w;
            }
        }
        if (std::fabs(weight) < 0.000001)
            return kNaN;
        return sum / weight;
    }

    // The separable kernel over taps that all lie inside the window, with normalised weights.
    template <typename T>
    static double Interior(const Plane<T>& p, int x0, const std::vector<double>& wx, int y0,
                           const std::vector<double>& wy) {
        const std::size_t nx = wx.size();
        const double* w = wx.data();
        double sum = 0.0;
        for (std::size_t j = 0; j < wy.size(); ++j) {
            const T* row = p.data + static_cast<std::ptrdiff_t>(y0 + j) * p.width + x0;
            double line = 0.0;
            for (std::size_t i = 0; i < nx; ++i)
                line += row[i] * w[i];
            sum += line * wy[j];
        }
        return sum;
    }

    template <typename T>
    void Interpolate(const std::vector<Plane<T>>& planes, const std::vector<Validity>& validity,
                     std::size_t n, const double* x, const double* y, double* values) const {
        const Plane<T>& p0 = planes.front();
        AxisWeights ax;
        AxisWeights ay;
        std::vector<double>& nx = ax.normalised;
        std::vector<double>& ny = ay.normalised;
        for (std::size_t i = 0; i < n; ++i) {
            int ix = 0;
            int iy = 0;
            if (!PixelOf(p0, x[i], y[i], ix, iy)) {
                for (std::size_t c = 0; c < planes.size(); ++c)
                    values[c * n + i] = kNaN;
                continue;
            }
            const double sx = x[i] - p0.x0;
            const double sy = y[i] - p0.y0;
            // Inside the window, the weights are normalised once for every channel.
            bool interior = false;
            if (!fourSamples_) {
                Weights(sx, radiusX_, scaleX_, ax);
                Weights(sy, radiusY_, scaleY_, ay);
                interior = Normalise(ax, p0.width, nx) && Normalise(ay, p0.height, ny);
            }
            for (std::size_t c = 0; c < planes.size(); ++c) {
                const Plane<T>& p = planes[c];
                const bool mayMiss = validity[c].template Possible<T>();
                // As in GDAL, a position on a missing pixel has no value, whatever its
                // neighbours hold.
                if (mayMiss && !validity[c].IsValid(static_cast<double>(p.At(ix, iy)))) {
                    values[c * n + i] = kNaN;
                } else if (interior && !mayMiss) {
                    values[c * n + i] = Interior(p, ax.first, nx, ay.first, ny);
                } else if (!fourSamples_) {
                    values[c * n + i] = Separable(p, validity[c], ax, ay);
                } else if (method_ == Method::Bilinear) {
                    values[c * n + i] = Bilinear4(p, validity[c], sx, sy);
                } else {
                    values[c * n + i] = Cubic4(p, validity[c], sx, sy);
                }
            }
        }
    }

    // Average and mode over the output pixel's footprint: stepX x stepY source pixels centred
    // on the position; pixels partly covered count by the covered part (average).
    template <typename T>
    void Area(const std::vector<Plane<T>>& planes, const std::vector<Validity>& validity,
              std::size_t n, const double* x, const double* y, double* values) const {
        const Plane<T>& p0 = planes.front();
        std::vector<std::pair<double, std::size_t>> counts;
        for (std::size_t i = 0; i < n; ++i) {
            int ix = 0;
            int iy = 0;
            if (!PixelOf(p0, x[i], y[i], ix, iy)) {
                for (std::size_t c = 0; c < planes.size(); ++c)
                    values[c * n + i] = kNaN;
                continue;
            }
            const double xMin = x[i] - p0.x0 - stepX_ / 2.0;
            const double xMax = x[i] - p0.x0 + stepX_ / 2.0;
            const double yMin = y[i] - p0.y0 - stepY_ / 2.0;
            const double yMax = y[i] - p0.y0 + stepY_ / 2.0;
            int x0 = static_cast<int>(std::max(std::floor(xMin + 1e-10), 0.0));
            int x1 = static_cast<int>(std::min(std::ceil(xMax - 1e-10), double(p0.width)));
            int y0 = static_cast<int>(std::max(std::floor(yMin + 1e-10), 0.0));
            int y1 = static_cast<int>(std::min(std::ceil(yMax - 1e-10), double(p0.height)));
            if (x0 == x1 && x1 < p0.width)
                ++x1;
            if (y0 == y1 && y1 < p0.height)
                ++y1;
            auto weightX = [&](int xx) {
                if (x0 + 1 == x1)
                    return 1.0;
                if (xx == x0)
                    return 1.0 - (xMin - x0 > 0.0 ? xMin - x0 : 0.0);
                if (xx + 1 == x1)
                    return 1.0 - (x1 - xMax > 0.0 ? x1 - xMax : 0.0);
                return 1.0;
            };
            auto weightY = [&](int yy) {
                if (y0 + 1 == y1)
                    return 1.0;
                if (yy == y0)
                    return 1.0 - (yMin - y0 > 0.0 ? yMin - y0 : 0.0);
                if (yy + 1 == y1)
                    return 1.0 - (y1 - yMax > 0.0 ? y1 - yMax : 0.0);
                return 1.0;
            };
            for (std::size_t c = 0; c < planes.size(); ++c) {
                const Plane<T>& p = planes[c];
                double result = kNaN;
                if (method_ == Method::Average) {
                    double sum = 0.0;
                    double weight = 0.0;
                    for (int yy = y0; yy < y1; ++yy) {
                        const double wy = weightY(yy);
                        for (int xx = x0; xx < x1; ++xx) {
                            const double v = p.At(xx, yy);
                            if (!validity[c].IsValid(v))
                                continue;
                            const double w = wy * weightX(xx);
                            sum += v * w;
                            weight += w;
                        }
                    }
                    if (weight > 0.0)
                        result = sum / weight;
                } else {
                    // The first value to reach the highest count wins, as in GDAL.
                    counts.clear();
                    std::size_t best = 0;
                    std::size_t bestCount = 0;
                    for (int yy = y0; yy < y1; ++yy) {
                        for (int xx = x0; xx < x1; ++xx) {
                            const double v = p.At(xx, yy);
                            if (!validity[c].IsValid(v))
                                continue;
                            std::size_t k = 0;
                            while (k < counts.size() && counts[k].first != v)
                                ++k;
                            if (k == counts.size())
                                counts.emplace_back(v, 0);
                            if (++counts[k].second > bestCount) {
                                bestCount = counts[k].second;
                                best = k;
                            }
                        }
                    }
                    if (bestCount > 0)
                        result = counts[best].first;
                }
                values[c * n + i] = result;
            }
        }
    }

    static constexpr std::size_t kTableSteps = 4096;

    Method method_;
    double stepX_ = 1.0;
    double stepY_ = 1.0;
    double scaleX_ = 1.0;
    double scaleY_ = 1.0;
    int filterRadius_ = 0;
    int radiusX_ = 0;
    int radiusY_ = 0;
    bool fourSamples_ = false;
    std::vector<double> table_;
};

std::string Lower(std::string text) {
    std::transform(text.begin(), text.end(), text.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return text;
}

}  // namespace

ResamplerFactory::ResamplerFactory() = default;
ResamplerFactory::~ResamplerFactory() = default;

IRasterResampler* ResamplerFactory::GetResampler(std::string method) const {
    method = Lower(method);
    if (method == "nearest")
        method = "near";
    for (const auto& m : kMethods) {
        if (method == m.name)
            return new Resampler(m.method);
    }
    return nullptr;
}

std::vector<std::string> ResamplerFactory::GetMethods() {
    std::vector<std::string> names;
    for (const auto& m : kMethods)
        names.emplace_back(m.name);
    return names;
}

}  // namespace utils
}  // namespace kestrel
