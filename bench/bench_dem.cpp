// Height queries on a large raster DEM: 1,000,000 bilinear heights at random points over a
// 10,000 x 10,000 Float32 tiled GeoTIFF (400 MB), in the DEM's datum and converted from MSL to
// the ellipsoid, against gdallocationinfo -valonly answering the same points (nearest post).
//
// usage: bench_dem [--points N] [--skip-gdal]
// The DEM is generated once into the scratch directory, by a child run of this program so that
// the generation does not count in the peak memory.
#include <kestrel/dem.h>

#include "support.h"

#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include <gdal_priv.h>
#include <ogr_spatialref.h>

namespace {

constexpr int kSize = 10000;
constexpr double kLeft = 500000, kTop = 5040000, kStep = 1.0;

int MakeDem(const std::string& path) {
    GDALAllRegister();
    GDALSetCacheMax64(64 << 20);
    const char* options[] = {"TILED=YES", "BLOCKXSIZE=256", "BLOCKYSIZE=256", "BIGTIFF=YES",
                             nullptr};
    GDALDatasetUniquePtr ds(GetGDALDriverManager()->GetDriverByName("GTiff")->Create(
        path.c_str(), kSize, kSize, 1, GDT_Float32, const_cast<char**>(options)));
    if (!ds)
        return 1;
    double transform[6] = {kLeft, kStep, 0, kTop, 0, -kStep};
    ds->SetGeoTransform(transform);
    OGRSpatialReference srs;
    srs.SetFromUserInput("EPSG:32632+5773");
    ds->SetSpatialRef(&srs);
    GDALRasterBand* band = ds->GetRasterBand(1);
    band->SetNoDataValue(-32768);
    std::vector<float> rows(static_cast<std::size_t>(kSize) * 256);
    for (int y0 = 0; y0 < kSize; y0 += 256) {
        const int n = std::min(256, kSize - y0);
        for (int j = 0; j < n; ++j)
            for (int i = 0; i < kSize; ++i)
                rows[static_cast<std::size_t>(j) * kSize + i] = static_cast<float>(
                    300 + 80 * std::sin(i * 0.002) * std::cos((y0 + j) * 0.0013) + 0.01 * i);
        if (band->RasterIO(GF_Write, 0, y0, kSize, n, rows.data(), kSize, n, GDT_Float32, 0, 0,
                           nullptr) != CE_None)
            return 1;
    }
    return 0;
}

// Processor time of this process and of its finished children, where the system tells it: the
// machine may be shared, and processor time is what a comparison can rely on then.
double CpuSeconds(bool children) {
#if defined(_WIN32)
    (void)children;
    return NAN;
#else
    rusage usage{};
    getrusage(children ? RUSAGE_CHILDREN : RUSAGE_SELF, &usage);
    return usage.ru_utime.tv_sec + usage.ru_stime.tv_sec +
           (usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
#endif
}

double Seconds(std::chrono::steady_clock::time_point start) {
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

// Wall time of the queries; cpu receives their processor time.
double QueryAll(kestrel::dem::IRasterDEM& dem, const std::vector<double>& x,
                const std::vector<double>& y, std::vector<double>& h, unsigned int threads,
                double& cpu) {
    const double cpuStart = CpuSeconds(false);
    const auto start = std::chrono::steady_clock::now();
    std::vector<std::thread> pool;
    const std::size_t share = (x.size() + threads - 1) / threads;
    for (unsigned int t = 0; t < threads; ++t) {
        const std::size_t begin = t * share, end = std::min(x.size(), begin + share);
        pool.emplace_back(
            [&, begin, end] { dem.GetHeights(end - begin, &x[begin], &y[begin], &h[begin]); });
    }
    for (auto& th : pool)
        th.join();
    cpu = CpuSeconds(false) - cpuStart;
    return Seconds(start);
}

}  // namespace

int main(int argc, char** argv) {
    if (argc == 3 && std::string(argv[1]) == "--make")
        return MakeDem(argv[2]);
    std::size_t count = 1000000;
    bool gdal = true;
    for (int i = 1; i < argc; ++i) {
        const std::string a = argv[i];
        if (a == "--points" && i + 1 < argc)
            count = std::strtoull(argv[++i], nullptr, 10);
        else if (a == "--skip-gdal")
            gdal = false;
    }

    const auto dir = benchsupport::ScratchDir("dem");
    const std::string path = (dir / "dem10000.tif").string();
    if (!std::filesystem::exists(path)) {
        std::printf("generating %s ...\n", path.c_str());
        const auto start = std::chrono::steady_clock::now();
        const std::string command = "\"" + std::string(argv[0]) + "\" --make \"" + path + "\"";
        if (std::system(command.c_str()) != 0) {
            std::fprintf(stderr, "cannot generate %s\n", path.c_str());
            std::filesystem::remove(path);
            return 1;
        }
        std::printf("generated in %.1f s\n", Seconds(start));
    }

    std::mt19937_64 random(42);
    std::uniform_real_distribution<double> u(0.0, kSize * kStep);
    std::vector<double> x(count), y(count), h(count);
    for (std::size_t k = 0; k < count; ++k) {
        x[k] = kLeft + u(random);
        y[k] = kTop - u(random);
    }
    const std::string points = (dir / "points.txt").string();
    {
        std::ofstream out(points);
        char line[64];
        for (std::size_t k = 0; k < count; ++k) {
            std::snprintf(line, sizeof line, "%.3f %.3f\n", x[k], y[k]);
            out << line;
        }
    }
    const double before = benchsupport::PeakMemoryBytes() / 1048576.0;
    std::printf(
        "%zu random points over a %d x %d Float32 DEM (256 x 256 tiles); peak memory "
        "before opening it %.0f MB\n",
        count, kSize, kSize, before);

    struct Run {
        const char* name;
        kestrel::ogc::cs::DatumType out;
        unsigned int threads;
        int cacheMegabytes;
        double wall = 0, cpu = 0;
    } runs[] = {{"MSL, 1 thread, cache 64 MB", kestrel::ogc::cs::DatumMSL, 1, 64},
                {"MSL -> ellipsoid, 1 thread", kestrel::ogc::cs::DatumEllipsoid, 1, 64},
                {"MSL -> ellipsoid, 2 threads", kestrel::ogc::cs::DatumEllipsoid, 2, 64},
                {"MSL, 1 thread, cache 256 MB", kestrel::ogc::cs::DatumMSL, 1, 256}};
    for (auto& run : runs) {
        std::unique_ptr<kestrel::dem::IRasterDEM> dem(kestrel::dem::DEMFactory::CreateFileRasterDEM(
            path, 1, 0.0, 1.0, NAN, kestrel::ogc::cs::DatumMSL, false, run.cacheMegabytes));
        dem->SetOutputVerticalDatum(run.out);
        double againCpu = 0;
        run.wall = QueryAll(*dem, x, y, h, run.threads, run.cpu);
        const double again = QueryAll(*dem, x, y, h, run.threads, againCpu);
        std::size_t missing = 0;
        for (double v : h)
            missing += std::isnan(v);
        std::printf(
            "%-30s %.3f s (processor %.3f s, %.2f M points/s), again %.3f s; %zu without "
            "height; peak memory %.0f MB (+%.0f MB)\n",
            run.name, run.wall, run.cpu, count / run.wall / 1e6, again, missing,
            benchsupport::PeakMemoryBytes() / 1048576.0,
            benchsupport::PeakMemoryBytes() / 1048576.0 - before);
    }

    if (gdal) {
        const double cpuStart = CpuSeconds(true);
        const auto start = std::chrono::steady_clock::now();
        const std::string command = "gdallocationinfo -valonly -geoloc \"" + path + "\" < \"" +
                                    points + "\" > \"" + (dir / "gdal.txt").string() + "\"";
        if (std::system(command.c_str()) != 0)
            std::fprintf(stderr, "gdallocationinfo failed\n");
        const double seconds = Seconds(start);
        const double cpu = CpuSeconds(true) - cpuStart;
        std::printf(
            "gdallocationinfo -valonly (nearest post) %.3f s (processor %.3f s, %.2f M "
            "points/s)\n",
            seconds, cpu, count / seconds / 1e6);
        for (int r = 0; r < 4; r += 1) {
            std::printf(
                "throughput of \"%s\" over gdallocationinfo's: %.1f x (processor "
                "time: %.1f x)\n",
                runs[r].name, seconds / runs[r].wall, cpu / runs[r].cpu);
        }
    }
    return 0;
}
