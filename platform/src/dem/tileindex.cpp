#include "tileindex.h"

#include <cctype>
#include <vector>

#include <cpl_conv.h>
#include <cpl_vsi.h>
#include <gdal_priv.h>
#include <ogrsf_frmts.h>

#include <kestrel/exception.h>

#include <kestrel/gdalsupport.h>
#include "rasterdem.h"

namespace kestrel {
namespace dem {

namespace {

constexpr const char* kLocationField = "location";
constexpr const char* kDatumItem = "VERTICAL_DATUM";
// Blocks a tiled DEM holds: it has no argument that bounds them.
constexpr int kTiledCacheMegabytes = 64;

DatasetPtr OpenVector(const std::string& path) {
    return DatasetPtr(GDALDataset::Open(path.c_str(), GDAL_OF_VECTOR | GDAL_OF_READONLY),
                      [](GDALDataset* d) {
                          if (d != nullptr)
                              GDALClose(d);
                      });
}

OGRLayer* IndexLayer(GDALDataset* dataset) {
    if (dataset == nullptr || dataset->GetLayerCount() < 1)
        return nullptr;
    OGRLayer* layer = dataset->GetLayer(0);
    if (layer == nullptr || layer->GetLayerDefn()->GetFieldIndex(kLocationField) < 0)
        return nullptr;
    return layer;
}

ogc::cs::DatumType DatumFromKeyword(const std::string& path, const char* keyword) {
    std::string upper;
    for (const char* c = keyword; *c != '\0'; ++c)
        upper += static_cast<char>(std::toupper(static_cast<unsigned char>(*c)));
    if (upper == "MSL")
        return ogc::cs::DatumMSL;
    if (upper.compare(0, 3, "ELL") == 0)
        return ogc::cs::DatumEllipsoid;
    if (upper == "MATHMODEL")
        return ogc::cs::DatumMathModel;
    KESTREL_THROW(DataException,
                  FormatString("Tiled DEM %s: its %s \"%s\" is none of MSL, ELLIPS and MATHMODEL",
                               path.c_str(), kDatumItem, keyword));
}

// Whether a tile location names a file of this machine's file system: not a URL, not one of
// GDAL's virtual file systems (/vsicurl/, /vsizip/, ...) nor a driver's connection string, and
// an existing regular file.
bool IsLocalFile(const std::string& location) {
    if (location.find("://") != std::string::npos || STARTS_WITH_CI(location.c_str(), "/vsi") ||
        STARTS_WITH_CI(location.c_str(), "\\vsi"))
        return false;
    VSIStatBufL stat;
    return VSIStatL(location.c_str(), &stat) == 0 && VSI_ISREG(stat.st_mode);
}

// The tiles an index names, each a local file; a relative name is taken from the index's
// directory. Throws DataException naming the index and the feature of a tile that is not a
// local file, and when the index names none.
std::vector<std::string> TilesOf(const std::string& path, OGRLayer* layer) {
    const std::string directory = CPLGetPath(path.c_str());
    std::vector<std::string> tiles;
    layer->ResetReading();
    for (auto& feature : *layer) {
        const char* location = feature->GetFieldAsString(kLocationField);
        if (location == nullptr || *location == '\0')
            continue;
        const std::string tile = CPLIsFilenameRelative(location)
                                     ? CPLFormFilename(directory.c_str(), location, nullptr)
                                     : location;
        if (!IsLocalFile(tile)) {
            KESTREL_THROW(
                DataException,
                FormatString("Tiled DEM %s, feature %lld: the tile \"%s\" is not a "
                             "local file (a tile index may name only files of this "
                             "machine, not URLs or GDAL's /vsi... paths)",
                             path.c_str(), static_cast<long long>(feature->GetFID()), location));
        }
        tiles.push_back(tile);
    }
    if (tiles.empty())
        KESTREL_THROW(DataException, FormatString("Tiled DEM %s names no tile", path.c_str()));
    return tiles;
}

// The index's layer, or an exception naming the path.
OGRLayer* RequireIndexLayer(const std::string& path, GDALDataset* index,
                            const gdalsupport::ErrorCapture& errors) {
    OGRLayer* layer = IndexLayer(index);
    if (layer == nullptr) {
        KESTREL_THROW(FileAccessException, path, FileAccessException::OpenFailed,
                      FormatString("%s is not a tile index (a vector file whose first layer has "
                                   "a \"%s\" field): %s",
                                   path.c_str(), kLocationField, errors.Reason().c_str()));
    }
    return layer;
}

// The index's own datum: its VERTICAL_DATUM item, else that of its CRS or, without one, of
// tileSrs (the tiles'). reference gets the CRS's vertical reference, named after what gave the
// datum.
ogc::cs::DatumType IndexDatum(const std::string& path, GDALDataset* index, OGRLayer* layer,
                              const OGRSpatialReference* tileSrs,
                              ogc::utils::VerticalReference& reference) {
    const OGRSpatialReference* srs = layer->GetSpatialRef();
    if (srs == nullptr)
        srs = tileSrs;
    const std::unique_ptr<ogc::cs::ICRS> crs(srs != nullptr ? new ogc::cs::ICRS(*srs) : nullptr);
    reference = ogc::utils::GetVerticalReference(crs.get());
    const char* keyword = layer->GetMetadataItem(kDatumItem);
    if (keyword == nullptr)
        keyword = index->GetMetadataItem(kDatumItem);
    if (keyword != nullptr) {
        reference.name = std::string("its ") + kDatumItem + " item " + keyword;
        return DatumFromKeyword(path, keyword);
    }
    if (!reference.known)
        reference.name = std::string("neither a vertical CRS nor a ") + kDatumItem +
                         " item: a tile index's heights are then ellipsoidal";
    return ogc::utils::GetVerticalDatumType(crs.get());
}

}  // namespace

ogc::utils::VerticalReference TileIndexVerticalReference(const std::string& path) {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    const DatasetPtr index = OpenVector(path);
    OGRLayer* layer = RequireIndexLayer(path, index.get(), errors);
    const std::vector<std::string> tiles = TilesOf(path, layer);
    DatasetPtr first(GDALDataset::Open(tiles.front().c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY),
                     [](GDALDataset* d) {
                         if (d != nullptr)
                             GDALClose(d);
                     });
    ogc::utils::VerticalReference reference;
    const ogc::cs::DatumType datum =
        IndexDatum(path, index.get(), layer, first ? first->GetSpatialRef() : nullptr, reference);
    if (!reference.known)
        reference.unit = "metre";
    reference.known = true;
    reference.datum = datum;
    return reference;
}

bool IsTileIndex(const std::string& path) {
    if (path.empty())
        return false;
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture quiet;
    VSIStatBufL stat;
    if (VSIStatL(path.c_str(), &stat) == 0 && VSI_ISDIR(stat.st_mode))
        return false;
    const DatasetPtr index = OpenVector(path);
    return IndexLayer(index.get()) != nullptr;
}

std::unique_ptr<IRasterDEM> OpenTileIndexDEM(const std::string& path) {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    const DatasetPtr index = OpenVector(path);
    OGRLayer* layer = RequireIndexLayer(path, index.get(), errors);
    DatasetPtr mosaic = BuildMosaic(TilesOf(path, layer), path);
    RasterDEMOptions options;
    options.cacheMegabytes = kTiledCacheMegabytes;
    ogc::utils::VerticalReference reference;
    options.datum = IndexDatum(path, index.get(), layer, mosaic->GetSpatialRef(), reference);
    return MakeRasterDEM(std::move(mosaic), path, options);
}

}  // namespace dem
}  // namespace kestrel
