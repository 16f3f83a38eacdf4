// Models that relate image and ground in the plane: GCP polynomials and the geotransform.
#include <algorithm>
#include <cmath>
#include <memory>
#include <vector>

#include <gdal.h>
#include <ogr_spatialref.h>

#include <kestrel/exception.h>

#include "models.h"

namespace kestrel {
namespace mathmodel {

namespace {

std::unique_ptr<ogc::cs::ICRS> CopyCRS(const OGRSpatialReference* srs) {
    if (srs == nullptr || srs->IsEmpty())
        return nullptr;
    return std::make_unique<ogc::cs::ICRS>(*srs);
}

// A bivariate polynomial of order 1 or 2 on centred and scaled coordinates.
class Polynomial {
  public:
    Polynomial() = default;

    // Least-squares fit of value = f(u, v); false when the points do not determine it.
    bool Fit(int order, const std::vector<double>& u, const std::vector<double>& v,
             const std::vector<double>& value) {
        order_ = order;
        const std::size_t n = u.size();
        double su = 0, sv = 0;
        for (std::size_t i = 0; i < n; ++i)
            su += u[i], sv += v[i];
        centreU_ = su / n;
        centreV_ = sv / n;
        double spread = 0;
        for (std::size_t i = 0; i < n; ++i)
            spread = std::max({spread, std::fabs(u[i] - centreU_), std::fabs(v[i] - centreV_)});
        if (!(spread > 0))
            return false;
        scale_ = 1.0 / spread;
        const int m = TermCount();
        // Normal equations, solved by Gaussian elimination with partial pivoting.
        std::vector<double> a(static_cast<std::size_t>(m * (m + 1)), 0.0);
        double t[6];
        for (std::size_t i = 0; i < n; ++i) {
            Terms(u[i], v[i], t);
            for (int r = 0; r < m; ++r) {
                for (int c = 0; c < m; ++c)
                    a[r * (m + 1) + c] += t[r] * t[c];
                a[r * (m + 1) + m] += t[r] * value[i];
            }
        }
        for (int col = 0; col < m; ++col) {
            int pivot = col;
            for (int r = col + 1; r < m; ++r) {
                if (std::fabs(a[r * (m + 1) + col]) > std::fabs(a[pivot * (m + 1) + col]))
                    pivot = r;
            }
            if (std::fabs(a[pivot * (m + 1) + col]) < 1e-12)
                return false;
            for (int c = 0; c <= m; ++c)
                std::swap(a[col * (m + 1) + c], a[pivot * (m + 1) + c]);
            for (int r = 0; r < m; ++r) {
                if (r == col)
                    continue;
                const double f = a[r * (m + 1) + col] / a[col * (m + 1) + col];
                for (int c = col; c <= m; ++c)
                    a[r * (m + 1) + c] -= f * a[col * (m + 1) + c];
            }
        }
        for (int r = 0; r < m; ++r)
            coefficients_[r] = a[r * (m + 1) + m] / a[r * (m + 1) + r];
        return true;
    }

    double operator()(double u, double v) const {
        double t[6];
        Terms(u, v, t);
        double sum = 0;
        for (int i = 0; i < TermCount(); ++i)
            sum += coefficients_[i] * t[i];
        return sum;
    }

  private:
    int TermCount() const { return order_ == 1 ? 3 : 6; }
    void Terms(double u, double v, double t[6]) const {
        const double a = (u - centreU_) * scale_, b = (v - centreV_) * scale_;
        t[0] = 1, t[1] = a, t[2] = b, t[3] = a * a, t[4] = a * b, t[5] = b * b;
    }

    int order_ = 1;
    double centreU_ = 0, centreV_ = 0, scale_ = 1;
    double coefficients_[6] = {};
};

class GcpModel final : public IMathModel {
  public:
    GcpModel(std::unique_ptr<ogc::cs::ICRS> crs, unsigned int width, unsigned int height)
        : crs_(std::move(crs)), width_(width), height_(height) {}

    bool Fit(const GDAL_GCP* gcps, int count) {
        const int order = count >= 10 ? 2 : 1;
        std::vector<double> px, ln, gx, gy;
        for (int i = 0; i < count; ++i) {
            px.push_back(gcps[i].dfGCPPixel);
            ln.push_back(gcps[i].dfGCPLine);
            gx.push_back(gcps[i].dfGCPX);
            gy.push_back(gcps[i].dfGCPY);
        }
        return toPixel_.Fit(order, gx, gy, px) && toLine_.Fit(order, gx, gy, ln) &&
               toX_.Fit(order, px, ln, gx) && toY_.Fit(order, px, ln, gy);
    }

    const ogc::cs::ICRS* GetCRS() const override { return crs_.get(); }
    unsigned int GetImageWidth() const override { return width_; }
    unsigned int GetImageHeight() const override { return height_; }

    void GroundToImage(std::size_t n, const double* x, const double* y, const double*,
                       double* pixel, double* line, bool* ok) const override {
        for (std::size_t i = 0; i < n; ++i) {
            pixel[i] = toPixel_(x[i], y[i]);
            line[i] = toLine_(x[i], y[i]);
            ok[i] = std::isfinite(pixel[i]) && std::isfinite(line[i]);
        }
    }

    void ImageToGround(std::size_t n, const double* pixel, const double* line, const double*,
                       double* x, double* y, bool* ok) const override {
        for (std::size_t i = 0; i < n; ++i) {
            x[i] = toX_(pixel[i], line[i]);
            y[i] = toY_(pixel[i], line[i]);
            ok[i] = std::isfinite(x[i]) && std::isfinite(y[i]);
        }
    }

  private:
    std::unique_ptr<ogc::cs::ICRS> crs_;
    unsigned int width_, height_;
    Polynomial toPixel_, toLine_, toX_, toY_;
};

class GeoTransformModel final : public IMathModel {
  public:
    GeoTransformModel(const std::array<double, 6>& geoTransform, std::unique_ptr<ogc::cs::ICRS> crs,
                      unsigned int width, unsigned int height)
        : geocoding_(geoTransform), crs_(std::move(crs)), width_(width), height_(height) {}

    const ogc::cs::ICRS* GetCRS() const override { return crs_.get(); }
    unsigned int GetImageWidth() const override { return width_; }
    unsigned int GetImageHeight() const override { return height_; }

    void GroundToImage(std::size_t n, const double* x, const double* y, const double*,
                       double* pixel, double* line, bool* ok) const override {
        for (std::size_t i = 0; i < n; ++i) {
            geocoding_.GroundToPixel(x[i], y[i], pixel[i], line[i]);
            ok[i] = std::isfinite(pixel[i]) && std::isfinite(line[i]);
        }
    }

    void ImageToGround(std::size_t n, const double* pixel, const double* line, const double*,
                       double* x, double* y, bool* ok) const override {
        for (std::size_t i = 0; i < n; ++i) {
            geocoding_.PixelToGround(pixel[i], line[i], x[i], y[i]);
            ok[i] = std::isfinite(x[i]) && std::isfinite(y[i]);
        }
    }

  private:
    ogc::cs::GeocodingInfo geocoding_;
    std::unique_ptr<ogc::cs::ICRS> crs_;
    unsigned int width_, height_;
};

}  // namespace

std::unique_ptr<IMathModel> MakeGcpModel(const GDAL_GCP* gcps, int count,
                                         const OGRSpatialReference* srs, unsigned int width,
                                         unsigned int height, const std::string& path) {
    for (int i = 0; i < count; ++i) {
        const GDAL_GCP& g = gcps[i];
        if (!std::isfinite(g.dfGCPPixel) || !std::isfinite(g.dfGCPLine) ||
            !std::isfinite(g.dfGCPX) || !std::isfinite(g.dfGCPY)) {
            KESTREL_THROW(DataException,
                          FormatString("Ground control point %d of \"%s\" is not finite", i + 1,
                                       path.c_str()));
        }
    }
    auto model = std::make_unique<GcpModel>(CopyCRS(srs), width, height);
    if (count < 3 || !model->Fit(gcps, count)) {
        KESTREL_THROW(DataException,
                      FormatString("The %d ground control points of \"%s\" do not determine a "
                                   "polynomial model: at least 3 points not on one line are "
                                   "needed",
                                   count, path.c_str()));
    }
    return model;
}

std::unique_ptr<IMathModel> MakeGeoTransformModel(const std::array<double, 6>& geoTransform,
                                                  const OGRSpatialReference* srs,
                                                  unsigned int width, unsigned int height) {
    return std::make_unique<GeoTransformModel>(geoTransform, CopyCRS(srs), width, height);
}

}  // namespace mathmodel
}  // namespace kestrel
