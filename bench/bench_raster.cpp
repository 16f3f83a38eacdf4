// Raster reading and resampling on an 8,000 x 8,000 three-channel byte image, next to GDAL:
// - reading tile by tile through BasicReader, next to GDAL's own block reads;
// - resampling onto a grid shifted by a fraction of a pixel with 1.13 times larger pixels
//   (read windows, resample, write a tiled GeoTIFF), next to gdalwarp making the same grid.
// Each measurement runs in a process of its own so that its peak memory is its own.
//
//   bench_raster               every measurement, with a table of figures
//   bench_raster make          the test image only
//   bench_raster read | gdalread | resample METHOD THREADS
#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <gdal_priv.h>

#include <kestrel/rasterio.h>
#include <kestrel/resampler.h>

#include "support.h"

namespace {

using kestrel::datasources::BasicReader;
using kestrel::datasources::BasicWriter;
using kestrel::datasources::DataType;
using kestrel::gobs::Raster;

constexpr int kSize = 8000;
constexpr double kLeft = 500000.0;
constexpr double kTop = 4100000.0;
constexpr double kPixel = 0.5;

std::string ImagePath() {
    return (benchsupport::ScratchDir("raster") / "image.tif").string();
}

double Seconds(std::chrono::steady_clock::time_point start) {
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

// A tiled, uncompressed GeoTIFF with texture in every channel, made once.
void MakeImage() {
    const std::string path = ImagePath();
    if (std::filesystem::exists(path))
        return;
    GDALAllRegister();
    const std::string temp = path + ".part.tif";
    char** options = CSLSetNameValue(nullptr, "TILED", "YES");
    GDALDataset* ds = GetGDALDriverManager()->GetDriverByName("GTiff")->Create(
        temp.c_str(), kSize, kSize, 3, GDT_Byte, options);
    CSLDestroy(options);
    double gt[6] = {kLeft, kPixel, 0, kTop, 0, -kPixel};
    ds->SetGeoTransform(gt);
    OGRSpatialReference srs;
    srs.importFromEPSG(32632);
    ds->SetSpatialRef(&srs);
    std::vector<unsigned char> rows(static_cast<std::size_t>(kSize) * 256 * 3);
    unsigned int seed = 1;
    for (int y0 = 0; y0 < kSize; y0 += 256) {
        const int h = std::min(256, kSize - y0);
        for (int b = 0; b < 3; ++b)
            for (int y = 0; y < h; ++y)
                for (int x = 0; x < kSize; ++x) {
                    seed = seed * 1103515245u + 12345u;
                    rows[(static_cast<std::size_t>(b) * h + y) * kSize + x] =
                        static_cast<unsigned char>(((x + y0 + y) * (b + 1) / 7 + (seed >> 27)) &
                                                   255);
                }
        if (ds->RasterIO(GF_Write, 0, y0, kSize, h, rows.data(), kSize, h, GDT_Byte, 3, nullptr, 0,
                         0, 0, nullptr) != CE_None) {
            std::fprintf(stderr, "could not write %s\n", temp.c_str());
            std::exit(1);
        }
    }
    GDALClose(ds);
    std::filesystem::rename(temp, path);
}

// Processor time of this process so far (user + system), in seconds.
double CpuSeconds() {
#if defined(_WIN32)
    FILETIME created, exited, kernel, user;
    GetProcessTimes(GetCurrentProcess(), &created, &exited, &kernel, &user);
    auto seconds = [](const FILETIME& t) {
        return (static_cast<double>(t.dwHighDateTime) * 4294967296.0 + t.dwLowDateTime) * 1e-7;
    };
    return seconds(kernel) + seconds(user);
#else
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    return usage.ru_utime.tv_sec + usage.ru_stime.tv_sec +
           (usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) * 1e-6;
#endif
}

void Report(const char* what, double seconds, const std::string& extra = "") {
    std::printf("%-34s %8.3f s  cpu %8.3f s  peak %6.0f MB  %s\n", what, seconds, CpuSeconds(),
                benchsupport::PeakMemoryBytes() / 1e6, extra.c_str());
}

// Every tile through BasicReader, at the file's block size.
void ReadTiles() {
    const auto start = std::chrono::steady_clock::now();
    BasicReader reader(ImagePath());
    reader.SetOptimalTileSize();
    unsigned long long sum = 0;
    for (auto it = reader.Begin(); it != reader.End(); ++it) {
        std::unique_ptr<Raster> tile(*it);
        sum += static_cast<const unsigned char*>(tile->GetData())[tile->GetByteSize() / 2];
    }
    const double s = Seconds(start);
    Report("BasicReader tile by tile", s,
           std::to_string(static_cast<int>(3.0 * kSize * kSize / s / 1e6)) + " MB/s (check " +
               std::to_string(sum) + ")");
}

// GDAL's own block reads: every block of every band.
void ReadBlocks() {
    const auto start = std::chrono::steady_clock::now();
    GDALAllRegister();
    GDALDataset* ds = GDALDataset::Open(ImagePath().c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY);
    int bw = 0;
    int bh = 0;
    ds->GetRasterBand(1)->GetBlockSize(&bw, &bh);
    std::vector<unsigned char> block(static_cast<std::size_t>(bw) * bh);
    unsigned long long sum = 0;
    for (int by = 0; by < (kSize + bh - 1) / bh; ++by)
        for (int bx = 0; bx < (kSize + bw - 1) / bw; ++bx)
            for (int b = 1; b <= 3; ++b) {
                if (ds->GetRasterBand(b)->ReadBlock(bx, by, block.data()) != CE_None)
                    std::exit(1);
                sum += block[block.size() / 2];
            }
    GDALClose(ds);
    const double s = Seconds(start);
    Report("GDAL ReadBlock, every band", s,
           std::to_string(static_cast<int>(3.0 * kSize * kSize / s / 1e6)) + " MB/s (check " +
               std::to_string(sum) + ")");
}

struct Grid {
    double left;
    double top;
    double pixel;
    int width;
    int height;
};

Grid OutputGrid() {
    Grid g;
    g.pixel = kPixel * 1.13;
    g.left = kLeft + 0.37 * kPixel;
    g.top = kTop - 0.21 * kPixel;
    g.width = static_cast<int>((kSize - 0.37) * kPixel / g.pixel);
    g.height = static_cast<int>((kSize - 0.21) * kPixel / g.pixel);
    return g;
}

// Output tiles of 256 x 256: the source window under each with the kernel's margin is read,
// resampled and written; threads take tiles in turn.
void Resample(const std::string& method, int threads) {
    const auto start = std::chrono::steady_clock::now();
    const Grid g = OutputGrid();
    BasicReader reader(ImagePath());
    std::unique_ptr<kestrel::utils::IRasterResampler> resampler(
        kestrel::utils::ResamplerFactory().GetResampler(method));
    const double step = g.pixel / kPixel;
    resampler->SetSourceStep(step, step);
    const int margin = static_cast<int>(resampler->GetRadius()) + 1;
    const std::string out =
        (benchsupport::ScratchDir("raster") / ("ours_" + method + ".tif")).string();
    BasicWriter writer(out, {1, 2, 3}, "GTiff", "COMPRESS=NONE");
    writer.SetSize(g.width, g.height);
    writer.SetDataType(DataType::Byte);
    writer.SetGeocoding(kestrel::ogc::cs::GeocodingInfo::NorthUp(g.left, g.top, g.pixel, g.pixel));
    writer.SetCRS(reader.GetCRS());
    writer.SetNoDataValue(0);
    writer.SetTileSize(256, 256);
    writer.Create();
    const unsigned int tiles = writer.GetTileCount();
    std::mutex next;
    unsigned int taken = 0;
    auto work = [&] {
        std::vector<double> x;
        std::vector<double> y;
        std::vector<double> values;
        for (;;) {
            unsigned int index = 0;
            {
                std::lock_guard<std::mutex> lock(next);
                if (taken == tiles)
                    return;
                index = taken++;
            }
            const auto it = kestrel::datasources::RasterIterator(&writer, index);
            const unsigned int ox = it.GetX();
            const unsigned int oy = it.GetY();
            const unsigned int w = it.GetWidth();
            const unsigned int h = it.GetHeight();
            const std::size_t n = static_cast<std::size_t>(w) * h;
            x.resize(n);
            y.resize(n);
            values.resize(n * 3);
            for (unsigned int j = 0; j < h; ++j)
                for (unsigned int i = 0; i < w; ++i) {
                    x[j * w + i] = (g.left + (ox + i + 0.5) * g.pixel - kLeft) / kPixel;
                    y[j * w + i] = (kTop - g.top + (oy + j + 0.5) * g.pixel) / kPixel;
                }
            const int sx0 = std::max(0, static_cast<int>(std::floor(x.front())) - margin);
            const int sy0 = std::max(0, static_cast<int>(std::floor(y.front())) - margin);
            const int sx1 = std::min(kSize, static_cast<int>(std::floor(x.back())) + margin + 1);
            const int sy1 = std::min(kSize, static_cast<int>(std::floor(y.back())) + margin + 1);
            std::unique_ptr<Raster> source(reader.ReadWindow(sx0, sy0, sx1 - sx0, sy1 - sy0));
            resampler->ResampleAll(*source, n, x.data(), y.data(), values.data(), nullptr);
            Raster tile(w, h, 3, DataType::Byte);
            tile.SetOrigin(ox, oy);
            auto* bytes = static_cast<unsigned char*>(tile.GetData());
            for (std::size_t k = 0; k < 3 * n; ++k) {
                const double v = values[k];
                bytes[k] = std::isnan(v) ? 0
                           : v <= 0      ? 0
                           : v >= 255    ? 255
                                         : static_cast<unsigned char>(v + 0.5);
            }
            writer.Write(tile);
        }
    };
    std::vector<std::thread> pool;
    for (int t = 1; t < threads; ++t)
        pool.emplace_back(work);
    work();
    for (auto& t : pool)
        t.join();
    writer.Close();
    const std::string what =
        "ours " + method + ", " + std::to_string(threads) + " thread" + (threads > 1 ? "s" : "");
    Report(what.c_str(), Seconds(start),
           std::to_string(g.width) + " x " + std::to_string(g.height));
}

// gdalwarp making the same grid, timed with its peak memory from /usr/bin/time.
void Gdalwarp(const std::string& method, int threads) {
    const Grid g = OutputGrid();
    const std::string out =
        (benchsupport::ScratchDir("raster") / ("gdalwarp_" + method + ".tif")).string();
    const std::string log = out + ".time";
    char command[2048];
    std::snprintf(command, sizeof command,
                  "/usr/bin/time -f '%%e %%U %%S %%M' -o '%s' gdalwarp -q -overwrite -r %s -wo "
                  "NUM_THREADS=%d %s -co TILED=YES -te %.6f %.6f %.6f %.6f -tr %.6f %.6f '%s' '%s'",
                  log.c_str(), method.c_str(), threads, threads > 1 ? "-multi" : "", g.left,
                  g.top - g.height * g.pixel, g.left + g.width * g.pixel, g.top, g.pixel, g.pixel,
                  ImagePath().c_str(), out.c_str());
    if (std::system(command) != 0) {
        std::printf("gdalwarp failed: %s\n", command);
        return;
    }
    double seconds = 0;
    double user = 0;
    double system = 0;
    double kilobytes = 0;
    FILE* f = std::fopen(log.c_str(), "r");
    if (f != nullptr) {
        if (std::fscanf(f, "%lf %lf %lf %lf", &seconds, &user, &system, &kilobytes) != 4)
            seconds = kilobytes = 0;
        std::fclose(f);
    }
    std::printf("%-34s %8.3f s  cpu %8.3f s  peak %6.0f MB\n",
                ("gdalwarp -r " + method + ", " + std::to_string(threads) + " thread" +
                 (threads > 1 ? "s" : ""))
                    .c_str(),
                seconds, user + system, kilobytes * 1024 / 1e6);
}

int RunSelf(const std::string& self, const std::string& args) {
    std::fflush(stdout);
    return std::system(("'" + self + "' " + args).c_str());
}

}  // namespace

int main(int argc, char** argv) {
    const std::string mode = argc > 1 ? argv[1] : "all";
    if (mode == "make") {
        MakeImage();
    } else if (mode == "read") {
        ReadTiles();
    } else if (mode == "gdalread") {
        ReadBlocks();
    } else if (mode == "resample" && argc > 3) {
        Resample(argv[2], std::atoi(argv[3]));
    } else if (mode == "gdalwarp" && argc > 3) {
        Gdalwarp(argv[2], std::atoi(argv[3]));
    } else if (mode == "all") {
        MakeImage();
        std::printf(
            "8000 x 8000 x 3 Byte, tiled 256 x 256, uncompressed; output grid shifted by "
            "(0.37, 0.21) pixel, pixel x 1.13\n");
        for (int round = 0; round < 2; ++round) {  // the first round warms the file cache
            RunSelf(argv[0], "read");
            RunSelf(argv[0], "gdalread");
        }
        for (const char* method : {"bilinear", "cubic"}) {
            for (int threads : {1, 2}) {
                RunSelf(argv[0], std::string("resample ") + method + " " + std::to_string(threads));
                RunSelf(argv[0], std::string("gdalwarp ") + method + " " + std::to_string(threads));
            }
        }
    } else {
        std::fprintf(stderr,
                     "usage: %s [make | read | gdalread | resample METHOD THREADS | "
                     "gdalwarp METHOD THREADS]\n",
                     argv[0]);
        return 2;
    }
    return 0;
}
