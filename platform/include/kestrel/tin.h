// The TIN library: surface models held as triangulated irregular networks, read from vector
// files.
#pragma once

#include <cstddef>
#include <memory>

#include <kestrel/crs.h>
#include <kestrel/elevation.h>
#include <kestrel/export.h>

namespace kestrel {
namespace tin {

// A surface of triangles in the plane of its CRS with a height at each vertex. The height of a
// ground point is the plane of the triangle that holds it; a point in no triangle has no height.
//
// Configuration (SetOutputVerticalDatum, SetInputCRS) is not meant to run while another thread
// queries heights; the queries themselves may run on several threads at once.
class KESTREL_API TinReader : public dem::IElevationSource {
  public:
    virtual std::size_t GetTriangleCount() const = 0;
    // The datum of the heights the TIN holds; the output datum until one is set.
    virtual ogc::cs::DatumType GetVerticalDatum() const = 0;

  protected:
    TinReader() = default;
};

// Opens a TIN. docs/elevation.md tells what each argument means.
class KESTREL_API TinReaderFactoryImpl {
  public:
    virtual ~TinReaderFactoryImpl();

    // A new reader of the vector file at path (GeoPackage, Shapefile, ... as OGR opens them):
    // layer counts from 1 (0 is the first layer holding triangles or 3-D points); a height is
    // offset + scale * stored height; datum is that of the stored heights. Triangles are TIN,
    // triangle or polygon Z geometries with three corners; 3-D points are triangulated (Delaunay).
    // Null when the path cannot be opened or holds no such layer; DataException for a negative
    // layer number or a bad scale.
    virtual TinReader* CreateTinReader(const char* path, int layer, double offset, double scale,
                                       ogc::cs::DatumType datum) = 0;

  protected:
    TinReaderFactoryImpl() = default;
    TinReaderFactoryImpl(const TinReaderFactoryImpl&) = default;
    TinReaderFactoryImpl& operator=(const TinReaderFactoryImpl&) = default;
};

// The factory the processes call. Its calls go to the installed implementation, which is the
// built-in one unless a test has installed another.
class KESTREL_API TinReaderFactory {
  public:
    static TinReader* CreateTinReader(const char* path, int layer, double offset, double scale,
                                      ogc::cs::DatumType datum);

    // The built-in implementation, for an installed one that passes some calls on.
    static std::shared_ptr<TinReaderFactoryImpl> GetDefaultImplementation();
    // Installs impl (null restores the built-in one) and returns the one it replaces. Not meant
    // to be called while another thread opens a TIN.
    static std::shared_ptr<TinReaderFactoryImpl> SetImplementation(
        std::shared_ptr<TinReaderFactoryImpl> impl);
};

// Installs a factory implementation for its own lifetime and restores the previous one after.
class KESTREL_API ScopedTinReaderFactoryImpl {
  public:
    explicit ScopedTinReaderFactoryImpl(std::shared_ptr<TinReaderFactoryImpl> impl);
    ~ScopedTinReaderFactoryImpl();
    ScopedTinReaderFactoryImpl(const ScopedTinReaderFactoryImpl&) = delete;
    ScopedTinReaderFactoryImpl& operator=(const ScopedTinReaderFactoryImpl&) = delete;

  private:
    std::shared_ptr<TinReaderFactoryImpl> previous_;
};

}  // namespace tin
}  // namespace kestrel
