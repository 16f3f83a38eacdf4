// Occlusion recovery on synthetic scenes: N x N three-channel orthos whose visibility indexes
// hide rectangles (about a tenth of each scene), on one thread, for DBM pixel errors from 1 to
// 64 pixels and for 4 and 16 scenes. Time and peak memory of each run, in a child process of
// its own so that its peak memory is its own.
//
//   bench_recovery [SIZE]                      default: 512
//   bench_recovery --run DIR SCENES ERROR      (internal) one recovery run
#include <kestrel/trueortho.h>

#include "support.h"

#include <gdal_priv.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
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

void WriteRaster(const std::string& path, int size, int bands,
                 const std::vector<unsigned char>& values) {
    GDALDriver* gtiff = GetGDALDriverManager()->GetDriverByName("GTiff");
    const char* options[] = {"TILED=YES", nullptr};
    std::unique_ptr<GDALDataset> ds(gtiff->Create(path.c_str(), size, size, bands, GDT_Byte,
                                                  const_cast<char**>(options)));
    double gt[6] = {500000, 0.5, 0, 4100000, 0, -0.5};
    ds->SetGeoTransform(gt);
    for (int b = 1; b <= bands; ++b)
        ds->GetRasterBand(b)->SetNoDataValue(0);
    if (ds->RasterIO(GF_Write, 0, 0, size, size, const_cast<unsigned char*>(values.data()), size,
                     size, GDT_Byte, bands, nullptr, 0, 0, 0, nullptr) != CE_None)
        std::exit(1);
}

void Make(const std::string& dir, int size) {
    std::mt19937 random(1);
    for (int s = 0; s < kMaxScenes; ++s) {
        std::vector<unsigned char> vis(static_cast<size_t>(size) * size, 1);
        // Hidden rectangles of 8 to 40 pixels until about a tenth is hidden.
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
