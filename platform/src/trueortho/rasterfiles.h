// The generators' input rasters on GDAL, opened per thread. Outputs go through the platform's
// raster writer.
#pragma once

#include <kestrel/export.h>

#include <gdal.h>

#include <memory>
#include <string>
#include <vector>

class GDALDataset;

namespace kestrel {
namespace processes {
namespace trueortho {

struct KESTREL_API DatasetCloser {
    void operator()(GDALDataset* ds) const;
};
using DatasetPtr = std::unique_ptr<GDALDataset, DatasetCloser>;

// Opens a raster for reading; throws FileNotFoundException or DataException naming the path
// and GDAL's reason.
DatasetPtr OpenRaster(const std::string& path, const char* role);

// Reads a window of `count` bands as `type`, band after band; parts of the window outside the
// raster are left as they are in the buffer.
void ReadWindow(GDALDataset& ds, const std::string& path, const int* bands, int count, int x,
                int y, int width, int height, GDALDataType type, void* buffer);
inline void ReadWindow(GDALDataset& ds, const std::string& path, const std::vector<int>& bands,
                       int x, int y, int width, int height, float* buffer) {
    ReadWindow(ds, path, bands.data(), static_cast<int>(bands.size()), x, y, width, height,
               GDT_Float32, buffer);
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
