// Sensor (math) models: the relation between image positions and ground points.
#pragma once

#include <cstddef>

#include <kestrel/crs.h>
#include <kestrel/export.h>

namespace kestrel {
namespace mathmodel {

// Image positions are continuous pixel/line coordinates as in GeocodingInfo: (0, 0) is the
// top-left corner of the image, the centre of the first pixel is (0.5, 0.5). Ground points are
// in GetCRS() coordinates with heights in its vertical datum. The const operations may run on
// several threads at once.
class KESTREL_API IMathModel {
  public:
    virtual ~IMathModel();
    IMathModel(const IMathModel&) = delete;
    IMathModel& operator=(const IMathModel&) = delete;

    // The ground coordinate system, its vertical datum included.
    virtual const ogc::cs::ICRS* GetCRS() const = 0;
    virtual unsigned int GetImageWidth() const = 0;
    virtual unsigned int GetImageHeight() const = 0;

    // Ground to image for n points; ok[i] is false where the model has no answer.
    virtual void GroundToImage(std::size_t n, const double* x, const double* y, const double* z,
                               double* pixel, double* line, bool* ok) const = 0;
    // Image to ground at the given heights.
    virtual void ImageToGround(std::size_t n, const double* pixel, const double* line,
                               const double* z, double* x, double* y, bool* ok) const = 0;

  protected:
    IMathModel() = default;
};

}  // namespace mathmodel
}  // namespace kestrel
