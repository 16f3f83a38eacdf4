// Reading test rasters back through GDAL.
#pragma once

#include <gdal_priv.h>

#include <memory>
#include <string>
#include <vector>

namespace testsupport {

// A raster band read whole, as doubles; empty when the file or band cannot be read.
inline std::vector<double> ReadBand(const std::string& path, int band = 1) {
    GDALAllRegister();
    std::unique_ptr<GDALDataset> ds(
        GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
    if (!ds)
        return {};
    const int w = ds->GetRasterXSize(), h = ds->GetRasterYSize();
    std::vector<double> v(static_cast<size_t>(w) * h);
    if (ds->GetRasterBand(band)->RasterIO(GF_Read, 0, 0, w, h, v.data(), w, h, GDT_Float64, 0, 0,
                                          nullptr) != CE_None)
        return {};
    return v;
}

}  // namespace testsupport
