#include "tileindex.h"

#include <cctype>
#include <vector>

#include <cpl_conv.h>
#include <cpl_vsi.h>
#include <gdal_priv.h>
#include <ogrsf_frmts.h>

#include <kestrel/exception.h>

#include "../gdalsupport.h"
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

}  // namespace

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
    OGRLayer* layer = IndexLayer(index.get());
    if (layer == nullptr) {
        KESTREL_THROW(FileAccessException, path, FileAccessException::OpenFailed,
                      FormatString("%s is not a tile index (a vector file whose first layer has "
                                   "a \"%s\" field): %s",
                                   path.c_str(), kLocationField, errors.Reason().c_str()));
    }
    const std::string directory = CPLGetPath(path.c_str());
    std::vector<std::string> tiles;
    layer->ResetReading();
    for (auto& feature : *layer) {
        const char* location = feature->GetFieldAsString(kLocationField);
        if (location == nullptr || *location == '\0')
            continue;
        tiles.push_back(CPLIsFilenameRelative(location)
                            ? CPLFormFilename(directory.c_str(), location, nullptr)
                            : location);
    }
    if (tiles.empty()) {
        KESTREL_THROW(DataException, FormatString("Tiled DEM %s names no tile", path.c_str()));
    }

    RasterDEMOptions options;
    options.cacheMegabytes = kTiledCacheMegabytes;
    const char* keyword = layer->GetMetadataItem(kDatumItem);
    if (keyword == nullptr)
        keyword = index->GetMetadataItem(kDatumItem);
    DatasetPtr mosaic = BuildMosaic(tiles, path);
    if (keyword != nullptr) {
        options.datum = DatumFromKeyword(path, keyword);
    } else {
        const OGRSpatialReference* srs = layer->GetSpatialRef();
        if (srs == nullptr)
            srs = mosaic->GetSpatialRef();
        const std::unique_ptr<ogc::cs::ICRS> crs(srs != nullptr ? new ogc::cs::ICRS(*srs)
                                                                : nullptr);
        options.datum = ogc::utils::GetVerticalDatumType(crs.get());
    }
    return MakeRasterDEM(std::move(mosaic), path, options);
}

}  // namespace dem
}  // namespace kestrel
