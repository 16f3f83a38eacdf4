#include "rasterfiles.h"

#include <kestrel/gdalsupport.h>

#include <kestrel/exception.h>

#include <cpl_vsi.h>
#include <gdal_priv.h>

#include <algorithm>

namespace kestrel {
namespace processes {
namespace trueortho {

void DatasetCloser::operator()(GDALDataset* ds) const {
    gdalsupport::ErrorCapture errors;
    GDALClose(ds);
}

DatasetPtr OpenRaster(const std::string& path, const char* role) {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    VSIStatBufL stat;
    if (VSIStatL(path.c_str(), &stat) != 0)
        KESTREL_THROW(FileNotFoundException, path,
                      FormatString("The %s \"%s\" does not exist", role, path.c_str()));
    DatasetPtr ds(GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
    if (!ds)
        KESTREL_THROW(DataException, FormatString("The %s \"%s\" cannot be read as a raster: %s",
                                                  role, path.c_str(), errors.Reason().c_str()));
    return ds;
}

void ReadWindow(GDALDataset& ds, const std::string& path, const int* bands, int count, int x,
                int y, int width, int height, GDALDataType type, void* buffer) {
    // Only the part inside the raster is read.
    const int x0 = std::max(x, 0), y0 = std::max(y, 0);
    const int x1 = std::min(x + width, ds.GetRasterXSize());
    const int y1 = std::min(y + height, ds.GetRasterYSize());
    if (x1 <= x0 || y1 <= y0)
        return;
    gdalsupport::ErrorCapture errors;
    const GSpacing pixel = GDALGetDataTypeSizeBytes(type), line = pixel * width,
                   band = line * height;
    char* start = static_cast<char*>(buffer) +
                  ((y0 - y) * static_cast<std::ptrdiff_t>(width) + (x0 - x)) * pixel;
    if (ds.RasterIO(GF_Read, x0, y0, x1 - x0, y1 - y0, start, x1 - x0, y1 - y0, type, count,
                    const_cast<int*>(bands), pixel, line, band, nullptr) != CE_None)
        KESTREL_THROW(
            FileAccessException, path, FileAccessException::ReadFailed,
            FormatString("Reading %s at pixel %d, line %d (%d x %d) failed: %s", path.c_str(), x0,
                         y0, x1 - x0, y1 - y0, errors.Reason().c_str()));
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
