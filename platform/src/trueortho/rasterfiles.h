// The generators' raster files on GDAL: sources opened per thread, and outputs written under a
// temporary name and renamed only when complete.
#pragma once

#include <kestrel/crs.h>

#include <memory>
#include <mutex>
#include <string>
#include <vector>

class GDALDataset;

namespace kestrel {
namespace processes {
namespace trueortho {

struct DatasetCloser {
    void operator()(GDALDataset* ds) const;
};
using DatasetPtr = std::unique_ptr<GDALDataset, DatasetCloser>;

// Opens a raster for reading; throws FileNotFoundException or DataException naming the path
// and GDAL's reason.
DatasetPtr OpenRaster(const std::string& path, const char* role);

// Reads a window of the listed bands as Float32, band after band; parts of the window outside
// the raster are left as they are in the buffer.
void ReadWindow(GDALDataset& ds, const std::string& path, const std::vector<int>& bands, int x,
                int y, int width, int height, float* buffer);

// A raster being written. Created under "<path>.partial" (with the driver named), renamed to
// the final path by Commit; destroyed without Commit it deletes what it wrote.
class OutputRaster {
  public:
    OutputRaster(const std::string& path, const std::string& format, unsigned int pixels,
                 unsigned int lines, int bands, int gdalType, const ogc::cs::ICRS* crs,
                 const ogc::cs::GeocodingInfo& geocoding, double noData);
    ~OutputRaster();
    OutputRaster(const OutputRaster&) = delete;
    OutputRaster& operator=(const OutputRaster&) = delete;

    // Writes a window of all bands from a Float32 buffer (band after band); thread-safe.
    void Write(int x, int y, int width, int height, const float* buffer);
    void SetMetadataItem(const std::string& name, const std::string& value);
    void Commit();

  private:
    void Discard();
    std::string path_, temporary_;
    DatasetPtr ds_;
    std::mutex mutex_;
};

// Deletes a raster that a previous run left under a temporary or final name. Silent when there
// is none.
void RemoveRaster(const std::string& path);

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
