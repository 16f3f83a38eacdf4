// Small DEMs for the elevation tests, written with GDAL.
#pragma once

#include <array>
#include <functional>
#include <string>
#include <vector>

#include <stdexcept>

#include <cpl_string.h>
#include <gdal_priv.h>
#include <ogr_spatialref.h>

#include "program.h"

namespace testsupport {

// A north-up grid of posts: post (i, j) at the centre of pixel (i, j).
struct Grid {
    double left, top, step;
    int width, height;
    std::array<double, 6> Transform() const { return {left, step, 0, top, 0, -step}; }
    double X(double i) const { return left + (i + 0.5) * step; }
    double Y(double j) const { return top - (j + 0.5) * step; }
};

// Writes a Float32 GeoTIFF whose post (i, j) holds value(i, j); crs is any text OGR takes, or
// empty for none. creation lists GTiff creation options; noData is set when hasNoData.
inline void WriteDem(const std::string& path, const Grid& grid, const std::string& crs,
                     const std::function<float(int, int)>& value,
                     const std::vector<std::string>& creation = {}, bool hasNoData = false,
                     double noData = -32768.0, bool georeferenced = true) {
    GDALAllRegister();
    CPLStringList options;
    for (const auto& o : creation)
        options.AddString(o.c_str());
    GDALDriver* driver = GetGDALDriverManager()->GetDriverByName("GTiff");
    GDALDatasetUniquePtr ds(
        driver->Create(path.c_str(), grid.width, grid.height, 1, GDT_Float32, options.List()));
    if (georeferenced) {
        auto t = grid.Transform();
        ds->SetGeoTransform(t.data());
    }
    if (!crs.empty()) {
        OGRSpatialReference srs;
        srs.SetFromUserInput(crs.c_str());
        ds->SetSpatialRef(&srs);
    }
    std::vector<float> row(static_cast<std::size_t>(grid.width));
    GDALRasterBand* band = ds->GetRasterBand(1);
    if (hasNoData)
        band->SetNoDataValue(noData);
    for (int j = 0; j < grid.height; ++j) {
        for (int i = 0; i < grid.width; ++i)
            row[static_cast<std::size_t>(i)] = value(i, j);
        if (band->RasterIO(GF_Write, 0, j, grid.width, 1, row.data(), grid.width, 1, GDT_Float32, 0,
                           0, nullptr) != CE_None)
            throw std::runtime_error("cannot write " + path);
    }
}

}  // namespace testsupport
