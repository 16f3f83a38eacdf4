// What every elevation source answers: heights at ground points in a chosen vertical datum.
#pragma once

#include <cstddef>
#include <string>

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

    // The lowest and highest height, in the output datum, that GetHeights can give anywhere in
    // the rectangle (minX, minY)-(maxX, maxY) of the input CRS's coordinates. The range may be
    // wider than the heights inside (it is taken from summaries of small blocks of posts or
    // triangles), never narrower. False when the rectangle holds no height, or the source
    // cannot tell (the default).
    virtual bool GetHeightRange(double minX, double minY, double maxX, double maxY, double& lowest,
                                double& highest) const;

  protected:
    IElevationSource() = default;
};

// What the file of a surface model says of its heights, read without reading them: the CRS of
// a raster, of the first raster of a directory, of a TIN's first layer with a CRS; a tile
// index always has a datum of its own (its VERTICAL_DATUM item, else its CRS's). Throws
// FileNotFoundException naming the path when nothing is there, FileAccessException when GDAL
// cannot open it.
KESTREL_API ogc::utils::VerticalReference ReadVerticalReference(const std::string& path);

// How to open a surface model so that its heights are taken once, in metres, in the datum its
// file says.
struct SurfaceHeights {
    ogc::cs::DatumType datum = ogc::cs::DatumMSL;  // the datum to open the surface with
    // The factor of the declared unit, for the height scale; 1 when the file says its unit,
    // which the source then applies itself.
    double unitScale = 1.0;
    ogc::utils::VerticalReference file;  // what the file says
};

// The datum and unit to open the surface at path with. declaredDatum (null: none declared) and
// declaredUnit (empty: none; a name GetScale knows) are what the user says of the heights;
// where the file says nothing they are used (MSL and metres when not declared either). A
// declared datum or unit that contradicts the file is refused with a DataException naming the
// path, what the file says, what was declared and where (datumOrigin, unitOrigin: the options
// that declared them, "--elevref"). A declared DatumMathModel is not compared
// (the math model's datum is not known here): where the file says its datum, that is the
// datum returned, and the caller compares it with the model's.
KESTREL_API SurfaceHeights ResolveSurfaceHeights(
    const std::string& path, const ogc::cs::DatumType* declaredDatum,
    const std::string& declaredUnit, const std::string& datumOrigin = "the datum declared",
    const std::string& unitOrigin = "the unit declared");

}  // namespace dem
}  // namespace kestrel
