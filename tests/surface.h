// An elevation source for the tests: heights given by a function over a box.
#pragma once

#include <kestrel/dem.h>

#include <cmath>
#include <memory>
#include <string>

namespace testsupport {

// Ellipsoidal heights height(x, y) within the box, NaN outside; in `crs`, or in the caller's
// coordinates when it is empty.
class FunctionSurface final : public kestrel::dem::IElevationSource {
  public:
    FunctionSurface(double (*height)(double, double), double minX, double minY, double maxX,
                    double maxY, const std::string& crs = "EPSG:32632")
        : height_(height),
          crs_(crs.empty() ? nullptr : std::make_unique<kestrel::ogc::cs::ICRS>(crs)),
          box_{minX, minY, maxX, maxY} {}
    void SetOutputVerticalDatum(kestrel::ogc::cs::DatumType) override {}
    kestrel::ogc::cs::DatumType GetOutputVerticalDatum() const override {
        return kestrel::ogc::cs::DatumEllipsoid;
    }
    const kestrel::ogc::cs::ICRS* GetCRS() const override { return crs_.get(); }
    void GetExtent(double& minX, double& minY, double& maxX, double& maxY) const override {
        minX = box_[0], minY = box_[1], maxX = box_[2], maxY = box_[3];
    }
    void SetInputCRS(const kestrel::ogc::cs::ICRS*) override {}
    void GetHeights(std::size_t n, const double* x, const double* y,
                    double* heights) const override {
        for (std::size_t i = 0; i < n; ++i) {
            const bool inside =
                x[i] >= box_[0] && x[i] <= box_[2] && y[i] >= box_[1] && y[i] <= box_[3];
            heights[i] = inside ? height_(x[i], y[i]) : NAN;
        }
    }

  private:
    double (*height_)(double, double);
    std::unique_ptr<kestrel::ogc::cs::ICRS> crs_;
    double box_[4];
};

}  // namespace testsupport
