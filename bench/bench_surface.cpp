// Surface models whatever the data: TIN lookups on a clean TIN of 250 x 250 points beside the
// same TIN with one point 10,000 km away and beside a TIN of long slivers; and the height range
// of every 256 x 256-post tile of a 4,000 x 4,000 DEM from the range query (first and second
// pass) beside the heights of all its posts.
//
// usage: bench_surface
#include <kestrel/dem.h>
#include <kestrel/tin.h>

#include "support.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include <gdal_priv.h>
#include <ogr_spatialref.h>
#include <ogrsf_frmts.h>

namespace {

double Seconds(std::chrono::steady_clock::time_point start) {
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

double Ground(double x, double y) {
    return 300 + 40 * std::sin(x * 0.01) * std::cos(y * 0.013);
}

// A layer of points or triangles in a new GeoPackage.
void WriteTin(const std::string& path, bool outlier, bool slivers) {
    GDALDatasetUniquePtr ds(GetGDALDriverManager()->GetDriverByName("GPKG")->Create(
        path.c_str(), 0, 0, 0, GDT_Unknown, nullptr));
    OGRSpatialReference srs;
    srs.SetFromUserInput("EPSG:32632");
    OGRLayer* layer =
        ds->CreateLayer("surface", &srs, slivers ? wkbPolygon25D : wkbPoint25D, nullptr);
    layer->StartTransaction();
    const auto add = [&](const OGRGeometry& g) {
        OGRFeature feature(layer->GetLayerDefn());
        feature.SetGeometry(&g);
        layer->CreateFeature(&feature);
    };
    if (slivers) {
        // A sheared strip 1,000 m long cut into triangles 0.2 m wide.
        for (int i = 0; i < 60000; ++i) {
            const double b = i * 0.2, s = 1000;
            const double c[2][3][2] = {{{b, 0}, {b + 0.2, 0}, {b + s, s}},
                                       {{b + 0.2, 0}, {b + 0.2 + s, s}, {b + s, s}}};
            for (const auto& t : c) {
                OGRLinearRing ring;
                for (const auto& p : t)
                    ring.addPoint(p[0], p[1], Ground(p[0], p[1]));
                ring.closeRings();
                OGRPolygon polygon;
                polygon.addRing(&ring);
                add(polygon);
            }
        }
    } else {
        for (int j = 0; j < 250; ++j)
            for (int i = 0; i < 250; ++i)
                add(OGRPoint(i * 4.0, j * 4.0, Ground(i * 4.0, j * 4.0)));
        if (outlier)
            add(OGRPoint(1e7, 500, 5000));
    }
    layer->CommitTransaction();
}

void BenchTin(const std::string& dir, const char* name, bool outlier, bool slivers) {
    const std::string path = dir + "/" + name + ".gpkg";
    WriteTin(path, outlier, slivers);
    auto start = std::chrono::steady_clock::now();
    std::unique_ptr<kestrel::tin::TinReader> tin(kestrel::tin::TinReaderFactory::CreateTinReader(
        path.c_str(), 0, 0.0, 1.0, kestrel::ogc::cs::DatumMSL));
    const double open = Seconds(start);
    std::mt19937 random(5);
    std::uniform_real_distribution<double> u(0, 996);
    std::vector<double> x(1000000), y(x.size()), h(x.size());
    for (std::size_t k = 0; k < x.size(); ++k) {
        x[k] = u(random) + (slivers ? u(random) : 0.0);
        y[k] = slivers ? (x[k] - u(random)) : u(random);
        if (slivers) {
            y[k] = std::clamp(y[k], 0.0, 1000.0);
        }
    }
    start = std::chrono::steady_clock::now();
    tin->GetHeights(x.size(), x.data(), y.data(), h.data());
    const double lookups = Seconds(start);
    std::size_t found = 0;
    for (double v : h)
        found += !std::isnan(v);
    std::printf("%-22s %8zu triangles  open %6.2f s  1e6 heights %6.3f s  (%zu found)\n", name,
                tin->GetTriangleCount(), open, lookups, found);
}

void BenchRange(const std::string& dir) {
    const std::string path = dir + "/dem4000.tif";
    constexpr int kSize = 4000;
    {
        const char* options[] = {"TILED=YES", "BLOCKXSIZE=256", "BLOCKYSIZE=256", nullptr};
        GDALDatasetUniquePtr ds(GetGDALDriverManager()->GetDriverByName("GTiff")->Create(
            path.c_str(), kSize, kSize, 1, GDT_Float32, const_cast<char**>(options)));
        double transform[6] = {500000, 1, 0, 5040000, 0, -1};
        ds->SetGeoTransform(transform);
        OGRSpatialReference srs;
        srs.SetFromUserInput("EPSG:32632+5773");
        ds->SetSpatialRef(&srs);
        std::vector<float> row(kSize);
        for (int j = 0; j < kSize; ++j) {
            for (int i = 0; i < kSize; ++i)
                row[i] = static_cast<float>(Ground(i, j));
            if (j == 100)
                row[3900] = 1e6f;  // one outlier post
            ds->GetRasterBand(1)->RasterIO(GF_Write, 0, j, kSize, 1, row.data(), kSize, 1,
                                           GDT_Float32, 0, 0, nullptr);
        }
    }
    for (const auto datum : {kestrel::ogc::cs::DatumMSL, kestrel::ogc::cs::DatumEllipsoid}) {
        std::unique_ptr<kestrel::dem::IRasterDEM> dem(kestrel::dem::DEMFactory::CreateFileRasterDEM(
            path, 1, 0.0, 1.0, NAN, kestrel::ogc::cs::DatumMSL, false, 64));
        dem->SetOutputVerticalDatum(datum);
        const char* label = datum == kestrel::ogc::cs::DatumMSL ? "MSL" : "MSL -> ellipsoid";
        double widest = 0;
        std::size_t wide = 0;
        for (int pass = 0; pass < 2; ++pass) {
            const auto start = std::chrono::steady_clock::now();
            for (int ty = 0; ty < kSize; ty += 256) {
                for (int tx = 0; tx < kSize; tx += 256) {
                    double low, high;
                    dem->GetHeightRange(500000 + tx, 5040000 - ty - 256, 500000 + tx + 256,
                                        5040000 - ty, low, high);
                    widest = std::max(widest, high - low);
                    wide += high - low > 1000;
                }
            }
            std::printf("%-17s range of 256 tiles, pass %d: %7.4f s (tiles wider than 1 km: %zu)\n",
                        label, pass + 1, Seconds(start), wide);
            wide = 0;
        }
        // The honest way without the query: every post of every tile.
        const auto start = std::chrono::steady_clock::now();
        std::vector<double> x(256 * 256), y(x.size()), h(x.size());
        for (int ty = 0; ty < kSize; ty += 256) {
            for (int tx = 0; tx < kSize; tx += 256) {
                for (int j = 0; j < 256; ++j)
                    for (int i = 0; i < 256; ++i)
                        x[j * 256 + i] = 500000 + tx + i + 0.5,
                                    y[j * 256 + i] = 5040000 - ty - j - 0.5;
                dem->GetHeights(x.size(), x.data(), y.data(), h.data());
            }
        }
        std::printf("%-17s heights of every post of 256 tiles: %7.4f s\n", label, Seconds(start));
    }
}

}  // namespace

int main() {
    GDALAllRegister();
    const std::string dir = benchsupport::ScratchDir("surface").string();
    BenchTin(dir, "tin-clean", false, false);
    BenchTin(dir, "tin-outlier", true, false);
    BenchTin(dir, "tin-slivers", false, true);
    BenchRange(dir);
    return 0;
}
