// Occlusion recovery on synthetic scenes: N x N three-channel orthos whose visibility indexes
// hide rectangles (about a tenth of each scene), on one thread, for DBM pixel errors from 1 to
// 64 pixels and for 4 and 16 scenes, the choice per pixel. Time and peak memory of each run, in a child process of
// its own so that its peak memory is its own.
//
// --windows: scenes of 256 x 256 pixels on windows 128 pixels apart (each pixel in 4 scenes)
// over grids of 512 to 2048 pixels across (9 to 225 scenes), the choice per pixel ("per
// pixel"), the full pipeline (balance, seamlines, blending: "full") and, up to 1024, the choice
// per pixel on the same scenes padded to the whole grid as sparse GeoTIFFs ("padded", every
// scene read for every tile). Time per megapixel and peak memory should not grow with the
// number of scenes. GDAL's block cache is held to 64 MB so that peak memory is recovery's own.
//
//   bench_recovery [SIZE]                      default: 512
//   bench_recovery --windows
//   bench_recovery --run DIR SCENES ERROR      (internal) one recovery run
//   bench_recovery --run-windows DIR GRID PIPELINE  (internal)
#include <kestrel/trueortho.h>

#include "support.h"

#include <gdal_priv.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <random>
#include <string>
#include <vector>

#if defined(_WIN32)
#define popen _popen
#define pclose _pclose
#endif

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kMaxScenes = 16;

constexpr int kWindow = 256, kStep = 128;
constexpr int kPaddedGrid = 1024;  // scenes also padded to the grid up to this size

// A size x size raster at pixel (x, y) of the grid; with `padded`, a sparse GeoTIFF of the whole
// padded x padded grid holding it (blocks outside it are not written and read as 0).
void WriteRaster(const std::string& path, int size, int bands,
                 const std::vector<unsigned char>& values, int x = 0, int y = 0, int padded = 0) {
    GDALDriver* gtiff = GetGDALDriverManager()->GetDriverByName("GTiff");
    const char* options[] = {"TILED=YES", "SPARSE_OK=TRUE", nullptr};
    const int side = padded > 0 ? padded : size;
    std::unique_ptr<GDALDataset> ds(gtiff->Create(path.c_str(), side, side, bands, GDT_Byte,
                                                  const_cast<char**>(options)));
    const int ox = padded > 0 ? 0 : x, oy = padded > 0 ? 0 : y;
    double gt[6] = {500000 + 0.5 * ox, 0.5, 0, 4100000 - 0.5 * oy, 0, -0.5};
    ds->SetGeoTransform(gt);
    for (int b = 1; b <= bands; ++b)
        ds->GetRasterBand(b)->SetNoDataValue(0);
    if (ds->RasterIO(GF_Write, x - ox, y - oy, size, size, const_cast<unsigned char*>(values.data()),
                     size, size, GDT_Byte, bands, nullptr, 0, 0, 0, nullptr) != CE_None)
        std::exit(1);
}

// Visibility with hidden rectangles of 8 to 40 pixels until about a tenth is hidden.
std::vector<unsigned char> Visibility(std::mt19937& random, int size) {
    std::vector<unsigned char> vis(static_cast<size_t>(size) * size, 1);
    std::uniform_int_distribution<int> at(0, size - 1), side(8, 40);
    for (size_t hidden = 0; hidden < vis.size() / 10;) {
        const int x = at(random), y = at(random), w = side(random), h = side(random);
        for (int j = y; j < std::min(size, y + h); ++j)
            for (int i = x; i < std::min(size, x + w); ++i) {
                unsigned char& v = vis[static_cast<size_t>(j) * size + i];
                hidden += v == 1;
                v = 2;
            }
    }
    return vis;
}

// Scenes on windows kStep apart over a grid of `grid` pixels across, "sceneX_Y_*.tif"; each
// with its own exposure over a gentle gradient.
void MakeWindows(const std::string& dir, int grid) {
    std::mt19937 random(2);
    std::uniform_real_distribution<double> exposure(0.8, 1.2);
    for (int y = 0; y + kWindow <= grid; y += kStep)
        for (int x = 0; x + kWindow <= grid; x += kStep) {
            const std::string name = dir + "/scene" + std::to_string(x) + "_" + std::to_string(y);
            const double gain = exposure(random);
            std::vector<unsigned char> ortho(static_cast<size_t>(kWindow) * kWindow * 3);
            for (size_t k = 0; k < ortho.size(); ++k) {
                const size_t p = k % (static_cast<size_t>(kWindow) * kWindow);
                const int gx = x + static_cast<int>(p % kWindow), gy = y + static_cast<int>(p / kWindow);
                ortho[k] = static_cast<unsigned char>(gain * (60 + (gx + gy) % 100));
            }
            const std::vector<unsigned char> vis = Visibility(random, kWindow);
            WriteRaster(name + "_vis.tif", kWindow, 1, vis, x, y);
            WriteRaster(name + "_ortho.tif", kWindow, 3, ortho, x, y);
            if (grid <= kPaddedGrid) {
                WriteRaster(name + "_padded_vis.tif", kWindow, 1, vis, x, y, grid);
                WriteRaster(name + "_padded_ortho.tif", kWindow, 3, ortho, x, y, grid);
            }
        }
}

// mode 0: the choice per pixel; 1: the full pipeline; 2: the choice per pixel on the scenes
// padded to the grid.
int RunWindows(const std::string& dir, int grid, int mode) {
    const bool pipeline = mode == 1;
    const std::string kind = mode == 2 ? "_padded_" : "_";
    kestrel::processes::RecoveryJob job;
    for (int y = 0; y + kWindow <= grid; y += kStep)
        for (int x = 0; x + kWindow <= grid; x += kStep) {
            const std::string name = dir + "/scene" + std::to_string(x) + "_" + std::to_string(y);
            kestrel::processes::RecoveryScene scene;
            scene.orthoPath = name + kind + "ortho.tif";
            scene.visibilityPath = name + kind + "vis.tif";
            scene.dbmPixelError = 2;
            job.scenes.push_back(scene);
        }
    job.mosaicPath = dir + "/mosaic.tif";
    job.sourcePath = dir + "/source.tif";
    if (!pipeline) {
        job.seamlines = false, job.blendWidth = 0;
        job.balance = kestrel::processes::RecoveryJob::Balance::None;
    }
    kestrel::processes::GeneratorSettings settings;
    settings.threadCount = 1;
    GDALSetCacheMax64(64 << 20);
    const auto start = Clock::now();
    const auto result = kestrel::processes::OcclusionRecovery(settings).Recover(job);
    std::printf("%.3f %.1f %zu\n", std::chrono::duration<double>(Clock::now() - start).count(),
                benchsupport::PeakMemoryBytes() / 1e6, job.scenes.size());
    return result.completed ? 0 : 1;
}

int Windows(const char* self) {
    std::printf("scenes of %d x %d pixels every %d pixels (4 over each pixel), one thread\n",
                kWindow, kWindow, kStep);
    std::printf("%6s %7s %9s %10s %12s %9s\n", "grid", "scenes", "run", "seconds",
                "s per Mpx", "peak MB");
    for (const int grid : {512, 1024, 2048}) {
        const std::string dir =
            benchsupport::ScratchDir("recovery-windows-" + std::to_string(grid)).string();
        if (!std::filesystem::exists(dir + "/scene0_0_ortho.tif") ||
            (grid <= kPaddedGrid && !std::filesystem::exists(dir + "/scene0_0_padded_ortho.tif")))
            MakeWindows(dir, grid);
        for (const int mode : {2, 0, 1}) {
            if (mode == 2 && grid > kPaddedGrid)
                continue;
            const std::string command = std::string("\"") + self + "\" --run-windows \"" + dir +
                                        "\" " + std::to_string(grid) + " " + std::to_string(mode);
            std::unique_ptr<FILE, int (*)(FILE*)> pipe(popen(command.c_str(), "r"), pclose);
            double seconds = 0, megabytes = 0;
            size_t scenes = 0;
            if (!pipe || std::fscanf(pipe.get(), "%lf %lf %zu", &seconds, &megabytes, &scenes) != 3)
                return 1;
            const char* kinds[] = {"per pixel", "full", "padded"};
            std::printf("%6d %7zu %9s %10.3f %12.3f %9.1f\n", grid, scenes, kinds[mode], seconds,
                        seconds / (static_cast<double>(grid) * grid / 1e6), megabytes);
        }
    }
    return 0;
}

void Make(const std::string& dir, int size) {
    std::mt19937 random(1);
    for (int s = 0; s < kMaxScenes; ++s) {
        const std::vector<unsigned char> vis = Visibility(random, size);
        std::vector<unsigned char> ortho(vis.size() * 3, static_cast<unsigned char>(10 + s));
        const std::string name = dir + "/scene" + std::to_string(s);
        WriteRaster(name + "_vis.tif", size, 1, vis);
        WriteRaster(name + "_ortho.tif", size, 3, ortho);
    }
}

int RunOnce(const std::string& dir, int scenes, int error) {
    kestrel::processes::RecoveryJob job;
    for (int s = 0; s < scenes; ++s) {
        kestrel::processes::RecoveryScene scene;
        scene.orthoPath = dir + "/scene" + std::to_string(s) + "_ortho.tif";
        scene.visibilityPath = dir + "/scene" + std::to_string(s) + "_vis.tif";
        scene.dbmPixelError = error;
        job.scenes.push_back(scene);
    }
    job.mosaicPath = dir + "/mosaic.tif";
    job.sourcePath = dir + "/source.tif";
    job.seamlines = false, job.blendWidth = 0;  // the choice per pixel
    job.balance = kestrel::processes::RecoveryJob::Balance::None;
    kestrel::processes::GeneratorSettings settings;
    settings.threadCount = 1;
    const auto start = Clock::now();
    const auto result = kestrel::processes::OcclusionRecovery(settings).Recover(job);
    std::printf("%.3f %.1f\n", std::chrono::duration<double>(Clock::now() - start).count(),
                benchsupport::PeakMemoryBytes() / 1e6);
    return result.completed ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
    GDALAllRegister();
    if (argc == 5 && std::string(argv[1]) == "--run")
        return RunOnce(argv[2], std::atoi(argv[3]), std::atoi(argv[4]));
    if (argc == 5 && std::string(argv[1]) == "--run-windows")
        return RunWindows(argv[2], std::atoi(argv[3]), std::atoi(argv[4]));
    if (argc == 2 && std::string(argv[1]) == "--windows")
        return Windows(argv[0]);
    const int size = argc > 1 ? std::atoi(argv[1]) : 512;
    const std::string dir = benchsupport::ScratchDir("recovery-" + std::to_string(size)).string();
    Make(dir, size);
    std::printf("%d x %d pixels per scene, one thread\n", size, size);
    std::printf("%7s %6s %10s %12s\n", "scenes", "error", "seconds", "peak MB");
    for (const int scenes : {4, kMaxScenes})
        for (const int error : {1, 4, 16, 64}) {
            const std::string command = std::string("\"") + argv[0] + "\" --run \"" + dir + "\" " +
                                        std::to_string(scenes) + " " + std::to_string(error);
            std::unique_ptr<FILE, int (*)(FILE*)> pipe(popen(command.c_str(), "r"), pclose);
            double seconds = 0, megabytes = 0;
            if (!pipe || std::fscanf(pipe.get(), "%lf %lf", &seconds, &megabytes) != 2)
                return 1;
            std::printf("%7d %6d %10.3f %12.1f\n", scenes, error, seconds, megabytes);
        }
    return 0;
}
