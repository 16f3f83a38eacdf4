// What every elevation source answers: heights at ground points in a chosen vertical datum.
#pragma once

#include <cstddef>

#include <kestrel/crs.h>
#include <kestrel/export.h>

namespace kestrel {
namespace dem {

// The common face of raster DEMs and TIN readers. Height queries are const and may run on
// several threads at once on one object.
class KESTREL_API IElevationSource {
  public:
    virtual ~IElevationSource();
    IElevationSource(const IElevationSource&) = delete;
    IElevationSource& operator=(const IElevationSource&) = delete;

    // The datum of the heights delivered from then on.
    virtual void SetOutputVerticalDatum(ogc::cs::DatumType datum) = 0;
    virtual ogc::cs::DatumType GetOutputVerticalDatum() const = 0;

    // The coordinate system of the source's own ground coordinates.
    virtual const ogc::cs::ICRS* GetCRS() const = 0;
    // The ground area covered, in the source's own coordinates.
    virtual void GetExtent(double& minX, double& minY, double& maxX, double& maxY) const = 0;

    // Ground coordinates of later queries are in crs (copied); null means the source's own.
    virtual void SetInputCRS(const ogc::cs::ICRS* crs) = 0;

    // Heights at n ground points, in the output datum; NaN where there is no height (outside,
    // over no-data). Never a made-up number.
    virtual void GetHeights(std::size_t n, const double* x, const double* y,
                            double* heights) const = 0;

    // One point: false where there is no height.
    bool GetHeight(double x, double y, double& height) const;

  protected:
    IElevationSource() = default;
};

}  // namespace dem
}  // namespace kestrel
