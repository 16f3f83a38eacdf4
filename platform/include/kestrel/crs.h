// Coordinate systems, the placement of raster grids on the ground, and vertical datums.
#pragma once

#include <array>
#include <cstddef>
#include <memory>
#include <string>

#include <kestrel/export.h>

class OGRSpatialReference;

namespace kestrel {
namespace ogc {
namespace cs {

// The vertical datum that heights refer to.
enum DatumType : int {
    DatumMathModel = 2000,  // the datum of the sensor's math model
    DatumMSL = 2001,        // mean sea level (a geoid: EGM96 here)
    DatumEllipsoid = 2002   // the ellipsoid of the horizontal datum
};

// A coordinate reference system. Coordinates are always in the traditional GIS order:
// x = easting or longitude, y = northing or latitude, whatever the authority's axis order.
class KESTREL_API ICRS {
  public:
    // From any text OGR's SetFromUserInput takes: "EPSG:32632", WKT, PROJJSON, PROJ strings.
    // Throws DataException quoting the text and OGR's reason when it names no CRS.
    explicit ICRS(const std::string& definition);
    // A copy of an OGR spatial reference (for the platform's own use).
    explicit ICRS(const OGRSpatialReference& srs);
    ICRS(const ICRS& other);
    ICRS& operator=(const ICRS& other);
    virtual ~ICRS();

    virtual ICRS* Clone() const;

    std::string GetName() const;
    // WKT2 (2019) text, one line.
    std::string GetWKT() const;
    bool IsGeographic() const;
    bool IsProjected() const;
    bool IsCompound() const;
    unsigned int GetAxesCount() const;
    // Same horizontal and vertical definition (OGR's IsSame with the axis-order criterion off).
    bool IsSame(const ICRS& other) const;

    // The OGR object behind it, for the platform's components.
    const OGRSpatialReference& GetSpatialReference() const { return *srs_; }

  private:
    std::unique_ptr<OGRSpatialReference> srs_;
};

// Where a raster grid lies on the ground: GDAL's affine geotransform. Pixel and line
// coordinates are continuous, (0, 0) being the top-left corner of the first pixel, so the centre
// of pixel (i, j) is at (i + 0.5, j + 0.5).
class KESTREL_API GeocodingInfo {
  public:
    // The identity transform.
    GeocodingInfo();
    // From GDAL's six coefficients: x = g0 + pixel g1 + line g2, y = g3 + pixel g4 + line g5.
    // Throws DataException when the transform is not invertible or not finite.
    explicit GeocodingInfo(const std::array<double, 6>& geoTransform);
    // A north-up grid whose top-left corner is (left, top) with square or rectangular pixels.
    static GeocodingInfo NorthUp(double left, double top, double pixelWidth, double pixelHeight);

    const std::array<double, 6>& GetGeoTransform() const { return forward_; }
    double GetPixelWidth() const;   // ground length of one pixel step
    double GetPixelHeight() const;  // ground length of one line step (positive)

    void PixelToGround(double pixel, double line, double& x, double& y) const;
    void GroundToPixel(double x, double y, double& pixel, double& line) const;

  private:
    std::array<double, 6> forward_;
    std::array<double, 6> inverse_;
};

// Transforms points between two coordinate systems with PROJ. Heights pass through PROJ too, so
// a transformation between CRSs with different vertical datums changes them. One object per
// thread: PROJ's objects are not shared between threads (make a copy for each).
class KESTREL_API CoordinateTransformation {
  public:
    // Throws DataException naming both CRSs and PROJ's reason when PROJ has no transformation,
    // and when the only one it has is a "ballpark" one that ignores a datum or geoid grid.
    CoordinateTransformation(const ICRS& source, const ICRS& target);
    CoordinateTransformation(const CoordinateTransformation& other);
    CoordinateTransformation& operator=(const CoordinateTransformation&) = delete;
    ~CoordinateTransformation();

    // Transforms n points in place; z may be null. Points that fail become NaN; the result says
    // whether every point succeeded.
    bool Transform(std::size_t n, double* x, double* y, double* z = nullptr) const;

  private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace cs
}  // namespace ogc

namespace ogc {
namespace utils {

// The vertical datum of a coordinate system's heights: a compound CRS whose vertical part is a
// gravity-related height gives DatumMSL; a three-axis CRS without a vertical part (geographic
// 3-D, geocentric) gives DatumEllipsoid; a two-axis CRS has no vertical information and gives
// DatumEllipsoid, as a missing math model does. A null CRS gives DatumEllipsoid.
KESTREL_API cs::DatumType GetVerticalDatumType(const cs::ICRS* crs);

// What a coordinate system says about the heights given with it.
struct VerticalReference {
    // It has a vertical axis: a compound or vertical CRS, or a three-axis one.
    bool known = false;
    // When known: DatumMSL for a gravity-related height, DatumEllipsoid for an ellipsoidal one.
    cs::DatumType datum = cs::DatumEllipsoid;
    // Metres in one unit of its heights ("US survey foot": 1200/3937); 1 when not known.
    double metresPerUnit = 1.0;
    std::string unit;  // the unit's name, empty when not known
    std::string name;  // the name of its vertical part (or of the CRS), for messages
};

// The vertical reference of a coordinate system; a null or two-axis one gives known = false.
KESTREL_API VerticalReference GetVerticalReference(const cs::ICRS* crs);

// A new coordinate system from a map-units text (see ICRS(const std::string&)).
KESTREL_API cs::ICRS* MapunitsToCRS(const std::string& text);

}  // namespace utils
}  // namespace ogc
}  // namespace kestrel
