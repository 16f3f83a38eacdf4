// Raster DEMs read with GDAL: a file, a directory of tiles, or an opened mosaic.
#pragma once

#include <cmath>
#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include <kestrel/dem.h>

class GDALDataset;

namespace kestrel {
namespace dem {

struct RasterDEMOptions {
    unsigned int band = 1;  // from 1; 0 is the first band
    double offset = 0.0;    // height = offset + scale * stored value
    double scale = 1.0;
    float extraNoData = NAN;  // stored value without a height; NaN: none
    ogc::cs::DatumType datum = ogc::cs::DatumMSL;
    bool preload = false;     // the whole raster at once instead of by blocks
    int cacheMegabytes = 64;  // bound of the blocks held
};

// An opened GDAL dataset, closed with GDALClose.
using DatasetPtr = std::unique_ptr<GDALDataset, void (*)(GDALDataset*)>;
DatasetPtr NoDataset();

bool IsDirectory(const std::string& path);
// The rasters GDAL recognises in a directory, sorted by name, the first limit of them (0: all);
// FileNotFoundException when none.
std::vector<std::string> RastersIn(const std::string& directory, std::size_t limit = 0);

// A raster GDAL opens, or a directory of such rasters mosaicked. Throws a kestrel exception
// naming the path and the reason when it cannot be used.
std::unique_ptr<IRasterDEM> OpenRasterDEM(const std::string& path, const RasterDEMOptions& options);

// The in-memory mosaic of rasters (a VRT); name is what messages call it. Throws DataException
// when GDAL cannot mosaic them.
DatasetPtr BuildMosaic(const std::vector<std::string>& rasters, const std::string& name);

// A DEM on an opened dataset, which it takes over.
std::unique_ptr<IRasterDEM> MakeRasterDEM(DatasetPtr dataset, const std::string& name,
                                          const RasterDEMOptions& options);

}  // namespace dem
}  // namespace kestrel
