// A synthetic oblique scene for tests and benchmarks: an image with RPC coefficients over
// Milan (UTM zone 32 north) and a DEM below it, both written with GDAL.
#pragma once

#include <cmath>
#include <functional>
#include <string>
#include <vector>

#include <cpl_string.h>
#include <gdal_priv.h>
#include <ogr_spatialref.h>

namespace rpcscene {

// Coefficients of an image of width x height pixels looking about 20 degrees off nadir
// across the sample direction, with a little curvature and a non-trivial denominator. The
// image covers about 1.5 km x 1.1 km whatever its size in pixels.
inline CPLStringList RpcMetadata(unsigned int width, unsigned int height) {
    CPLStringList md;
    md.SetNameValue("LINE_OFF", CPLSPrintf("%.6f", height / 2.0));
    md.SetNameValue("SAMP_OFF", CPLSPrintf("%.6f", width / 2.0));
    md.SetNameValue("LAT_OFF", "45.46");
    md.SetNameValue("LONG_OFF", "9.19");
    md.SetNameValue("HEIGHT_OFF", "250");
    md.SetNameValue("LINE_SCALE", CPLSPrintf("%.6f", height / 2.0));
    md.SetNameValue("SAMP_SCALE", CPLSPrintf("%.6f", width / 2.0));
    md.SetNameValue("LAT_SCALE", "0.005");
    md.SetNameValue("LONG_SCALE", "0.01");
    md.SetNameValue("HEIGHT_SCALE", "200");
    // Terms: 1 L P H LP LH PH L2 P2 H2 PLH L3 LP2 LH2 L2P P3 PH2 L2H P2H H3
    md.SetNameValue("SAMP_NUM_COEFF", "0.001 1.0 0.02 0.12 0.01 0 0 0.003 0 0 0 0 0 0 0 0 0 0 0 0");
    md.SetNameValue("SAMP_DEN_COEFF", "1 0.001 0.002 0 0 0 0 0 0 0 0 0 0 0 0 0 0 0 0 0");
    md.SetNameValue("LINE_NUM_COEFF", "-0.002 0.02 -1.0 0.03 0 0 0 0 0.004 0 0 0 0 0 0 0 0 0 0 0");
    md.SetNameValue("LINE_DEN_COEFF", "1 0 0.001 0 0 0 0 0 0 0 0 0 0 0 0 0 0 0 0 0");
    return md;
}

// A Byte GeoTIFF with the RPC coefficients; sparse, so that a large one costs no disk space.
// options are GTiff creation options (e.g. "PROFILE=GeoTIFF", "RPB=YES").
inline void WriteRpcImage(const std::string& path, unsigned int width, unsigned int height,
                          std::vector<std::string> options = {}) {
    GDALAllRegister();
    CPLStringList create;
    create.AddString("SPARSE_OK=TRUE");
    create.AddString("TILED=YES");
    for (const auto& o : options)
        create.AddString(o.c_str());
    GDALDriver* gtiff = GetGDALDriverManager()->GetDriverByName("GTiff");
    GDALDataset* ds = gtiff->Create(path.c_str(), static_cast<int>(width), static_cast<int>(height),
                                    1, GDT_Byte, create.List());
    ds->SetMetadata(RpcMetadata(width, height).List(), "RPC");
    GDALClose(ds);
}

// A Float32 GeoTIFF DEM in UTM 32N (ellipsoidal heights, no vertical CRS) with posts every
// cell metres from (left, top), heights from height(x, y) at post centres.
inline void WriteDem(const std::string& path, double left, double top, double cell, int width,
                     int height, const std::function<double(double, double)>& heightAt) {
    GDALAllRegister();
    const char* options[] = {"TILED=YES", nullptr};
    GDALDriver* gtiff = GetGDALDriverManager()->GetDriverByName("GTiff");
    GDALDataset* ds =
        gtiff->Create(path.c_str(), width, height, 1, GDT_Float32, const_cast<char**>(options));
    double gt[6] = {left, cell, 0, top, 0, -cell};
    ds->SetGeoTransform(gt);
    OGRSpatialReference srs;
    srs.importFromEPSG(32632);
    ds->SetSpatialRef(&srs);
    std::vector<float> row(static_cast<std::size_t>(width));
    for (int j = 0; j < height; ++j) {
        for (int i = 0; i < width; ++i)
            row[i] = static_cast<float>(heightAt(left + (i + 0.5) * cell, top - (j + 0.5) * cell));
        if (ds->GetRasterBand(1)->RasterIO(GF_Write, 0, j, width, 1, row.data(), width, 1,
                                           GDT_Float32, 0, 0) != CE_None)
            break;
    }
    GDALClose(ds);
}

// Gentle hills over the scene: 150 m to 350 m.
inline double Hills(double x, double y) {
    return 250.0 + 60.0 * std::sin(x / 300.0) * std::cos(y / 400.0) + 0.02 * (x - 514000.0);
}

// The DEM area around the scene, in UTM 32N.
constexpr double kDemLeft = 511000.0;
constexpr double kDemTop = 5038000.0;
constexpr double kDemSize = 8000.0;

}  // namespace rpcscene
