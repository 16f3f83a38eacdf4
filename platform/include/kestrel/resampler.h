// Resampling: the value of a raster channel at fractional image positions, with the kernels and
// weights of GDAL's warper.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

#include <kestrel/export.h>
#include <kestrel/raster.h>

namespace kestrel {
namespace utils {

// A resampling method. Positions are image coordinates of the full image in GDAL's convention:
// (0, 0) is the top-left corner of the first pixel, the centre of pixel (i, j) is
// (i + 0.5, j + 0.5).
//
// Queries are const and may run on several threads at once on one object; SetSourceStep is
// not, and is meant to be called before the resampler is shared.
class KESTREL_API IRasterResampler {
  public:
    virtual ~IRasterResampler();
    IRasterResampler(const IRasterResampler&) = delete;
    IRasterResampler& operator=(const IRasterResampler&) = delete;

    // GDAL's name of the method: "near", "bilinear", "cubic", "cubicspline", "lanczos",
    // "average" or "mode".
    virtual std::string GetMethod() const = 0;

    // The distance in source pixels between neighbouring output pixels along x and along y
    // (1, 1 by default: output pixels as large as the source's). Above 1 (downsampling) the
    // interpolating kernels are widened by it as GDAL's warper widens them, and average and
    // mode take the output pixel's footprint of stepX x stepY source pixels. Throws
    // DataException for a step that is not finite and positive.
    virtual void SetSourceStep(double stepX, double stepY) = 0;
    virtual double GetSourceStepX() const = 0;
    virtual double GetSourceStepY() const = 0;

    // How far the kernel reaches: the value at a position inside pixel (i, j) reads only pixels
    // (i - r .. i + r, j - r .. j + r) with r = GetRadius(). A window read with this margin
    // around the positions (clipped to the image) gives the values GDAL gives on the whole
    // image.
    virtual unsigned int GetRadius() const = 0;

    // The values of channel c (0-based position in the window) of `window` at n positions
    // (x[i], y[i]) in full-image coordinates; the window lies at window.GetX(), GetY() in the
    // image. Pixels equal to *noData (when noData is not null; NaN always counts as no-data)
    // and pixels outside the window take no part, the weights of the others being
    // renormalised as GDAL does at image edges. values[i] is NaN where there is no value: the
    // position lies outside the window, or no valid pixel carries weight. Throws
    // DataException when c is not a channel of the window.
    virtual void Resample(const gobs::Raster& window, unsigned int c, std::size_t n,
                          const double* x, const double* y, double* values,
                          const double* noData) const = 0;

    // Every channel of the window at once (kernel weights computed once per position):
    // values[c * n + i] for channel c. noData is null or holds one value per channel (NaN for
    // a channel without one).
    virtual void ResampleAll(const gobs::Raster& window, std::size_t n, const double* x,
                             const double* y, double* values, const double* noData) const = 0;

  protected:
    IRasterResampler() = default;
};

// Makes resamplers by GDAL's method names, compared without regard to case.
class KESTREL_API ResamplerFactory {
  public:
    ResamplerFactory();
    ~ResamplerFactory();

    // A new resampler (owned by the caller) for the method, or null for a method it does not
    // know. "nearest" is taken for "near".
    IRasterResampler* GetResampler(std::string method) const;

    // The method names it knows, as GDAL spells them.
    static std::vector<std::string> GetMethods();
};

}  // namespace utils
}  // namespace kestrel
