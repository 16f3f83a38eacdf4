// The DEM library: raster digital elevation models and the factory that opens them.
#pragma once

#include <cstddef>
#include <memory>
#include <string>

#include <kestrel/crs.h>
#include <kestrel/elevation.h>
#include <kestrel/export.h>

namespace kestrel {
namespace dem {

// A DEM whose heights stand at the posts of a georeferenced grid. Post (i, j) is the centre of
// raster pixel (i, j), at GetGeocoding()->PixelToGround(i + 0.5, j + 0.5). Between posts heights
// are bilinear; posts without a height (no-data, or beyond the grid's edge) are left out and the
// weights of the others renormalised. A point outside the extent of the raster (the outer edges
// of its border pixels) has no height.
//
// Configuration (SetOutputVerticalDatum, SetInputCRS) is not meant to run while another thread
// queries heights; the queries themselves may run on several threads at once.
class KESTREL_API IRasterDEM : public IElevationSource {
  public:
    using IElevationSource::GetHeight;

    // Posts across (pixels) and down (lines).
    virtual unsigned int GetWidth() const = 0;
    virtual unsigned int GetHeight() const = 0;
    // Where the grid lies, in GetCRS() coordinates.
    virtual const ogc::cs::GeocodingInfo* GetGeocoding() const = 0;
    // The datum of the heights the DEM holds; the output datum until one is set.
    virtual ogc::cs::DatumType GetVerticalDatum() const = 0;

    // The posts that stand in the rectangle (minX, minY)-(maxX, maxY) of input CRS coordinates
    // (in the DEM's own CRS, the rectangle that holds it), and how many of them have no height
    // (no-data, masked, not finite). False when the DEM cannot tell (the default).
    virtual bool CountPosts(double minX, double minY, double maxX, double maxY, std::size_t& posts,
                            std::size_t& holes) const;

  protected:
    IRasterDEM() = default;
};

// The four ways of opening a DEM. Each returns a new object owned by the caller, never null: a
// DEM that cannot be built gives an exception of the kestrel family naming the path or value
// and the reason. docs/elevation.md tells what each argument means.
class KESTREL_API DEMFactoryImpl {
  public:
    virtual ~DEMFactoryImpl();

    // Whether path names a tiled DEM: a tile index made by gdaltindex (a vector file whose
    // first layer has a "location" field naming the tiles).
    virtual bool IsTileRasterDEMFile(const std::string& path) = 0;
    // The mosaic of a tile index's tiles; its datum is the index's own (see docs/elevation.md).
    virtual IRasterDEM* CreateTileRasterDEM(const std::string& path) = 0;
    // A raster that GDAL opens, or a directory of such rasters mosaicked. band counts from 1
    // (0 is the first band); a height is offset + scale * stored value; stored values equal to
    // noData have no height besides the raster's own no-data (NaN: none besides); datum is that
    // of the stored heights; preload reads the whole raster at once instead of by blocks;
    // cacheMegabytes bounds the blocks held (at least 1).
    virtual IRasterDEM* CreateFileRasterDEM(const std::string& path, unsigned int band,
                                            double offset, double scale, float noData,
                                            ogc::cs::DatumType datum, bool preload,
                                            int cacheMegabytes) = 0;
    // A DEM of one height over the width x height pixel grid that crs and geocoding describe,
    // with a post every downsampling pixels (at least 1) in each direction, the grid's edges
    // included.
    virtual IRasterDEM* CreateConstantDEMDownsampled(const ogc::cs::ICRS* crs,
                                                     const ogc::cs::GeocodingInfo* geocoding,
                                                     unsigned int width, unsigned int height,
                                                     float constantHeight, ogc::cs::DatumType datum,
                                                     float downsampling) = 0;

  protected:
    DEMFactoryImpl() = default;
    DEMFactoryImpl(const DEMFactoryImpl&) = default;
    DEMFactoryImpl& operator=(const DEMFactoryImpl&) = default;
};

// The factory the processes call. Its calls go to the installed implementation, which is the
// built-in one unless a test has installed another.
class KESTREL_API DEMFactory {
  public:
    static bool IsTileRasterDEMFile(const std::string& path);
    static IRasterDEM* CreateTileRasterDEM(const std::string& path);
    static IRasterDEM* CreateFileRasterDEM(const std::string& path, unsigned int band,
                                           double offset, double scale, float noData,
                                           ogc::cs::DatumType datum, bool preload,
                                           int cacheMegabytes);
    static IRasterDEM* CreateConstantDEMDownsampled(const ogc::cs::ICRS* crs,
                                                    const ogc::cs::GeocodingInfo* geocoding,
                                                    unsigned int width, unsigned int height,
                                                    float constantHeight, ogc::cs::DatumType datum,
                                                    float downsampling);

    // The built-in implementation, for an installed one that passes some calls on.
    static std::shared_ptr<DEMFactoryImpl> GetDefaultImplementation();
    // Installs impl (null restores the built-in one) and returns the one it replaces. Not meant
    // to be called while another thread opens a DEM.
    static std::shared_ptr<DEMFactoryImpl> SetImplementation(std::shared_ptr<DEMFactoryImpl> impl);
};

// Installs a factory implementation for its own lifetime and restores the previous one after.
class KESTREL_API ScopedDEMFactoryImpl {
  public:
    explicit ScopedDEMFactoryImpl(std::shared_ptr<DEMFactoryImpl> impl);
    ~ScopedDEMFactoryImpl();
    ScopedDEMFactoryImpl(const ScopedDEMFactoryImpl&) = delete;
    ScopedDEMFactoryImpl& operator=(const ScopedDEMFactoryImpl&) = delete;

  private:
    std::shared_ptr<DEMFactoryImpl> previous_;
};

// The factor that turns heights in a unit into metres. unit is upper case: METER, METRE, M and
// their plurals give 1; FOOT, FEET, FT 0.3048; the US survey foot (US_FOOT, US_FEET, USFT,
// FTUS, US_SURVEY_FOOT, US_SURVEY_FEET) 1200/3937. Throws DataException naming an unknown unit
// and listing the known ones.
KESTREL_API double GetScale(const std::string& unit);

}  // namespace dem
}  // namespace kestrel
