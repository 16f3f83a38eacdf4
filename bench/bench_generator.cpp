// The true-ortho generator on a synthetic town: an oblique RPC image of N x N pixels over a 1 m
// DSM, bilinear, onto an N x N grid at 0.5 m. Time and peak memory on 1 and 2 threads, next to
// gdalwarp with the RPC transformer on the DSM, which makes the same grid without detecting
// occlusions. Each run is a child process of its own so that its peak memory is its own; both
// run with GDAL's block cache at 64 MB (GDAL_CACHEMAX) and the DSM is read through the
// platform's file DEM with its 16 MB block cache.
//
//   bench_generator [SIZE ...]        default: 2000 4000
//   bench_generator --make DIR SIZE   (internal) writes the town
//   bench_generator --run DIR SIZE THREADS   (internal) one generator run
#include <kestrel/dem.h>
#include <kestrel/trueortho.h>
#include <samplecity.h>

#include "support.h"

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <limits>
#include <memory>
#include <sstream>
#include <string>

namespace {

using Clock = std::chrono::steady_clock;

double Seconds(Clock::time_point since) {
    return std::chrono::duration<double>(Clock::now() - since).count();
}

// The output grid: the central N x N pixels at 0.5 m of the town.
kestrel::ogc::cs::GeocodingInfo Grid(const samplecity::CityOptions& o, unsigned int size,
                                     double& west, double& south) {
    const double side = size * 0.5;
    west = o.west + (o.sizeX - side) / 2, south = o.south + (o.sizeY - side) / 2;
    return kestrel::ogc::cs::GeocodingInfo::NorthUp(west, south + side, 0.5, 0.5);
}

int Make(const std::string& dir, unsigned int size) {
    std::filesystem::create_directories(dir);
    const auto start = Clock::now();
    const samplecity::Sample sample = samplecity::MakeSample(dir, samplecity::BenchCity(size));
    std::printf("town of %u x %u pixels made in %.1f s (RPC fit within %.4f px)\n", size, size,
                Seconds(start), sample.images[0].rpcMaxResidual);
    return 0;
}

int RunOnce(const std::string& dir, unsigned int size, unsigned int threads) {
    const samplecity::CityOptions options = samplecity::BenchCity(size);
    // The platform's file DEM, read through its bounded block cache (16 MB).
    std::unique_ptr<kestrel::dem::IRasterDEM> surface(kestrel::dem::DEMFactory::CreateFileRasterDEM(
        dir + "/dsm.tif", 1, 0.0, 1.0, std::numeric_limits<float>::quiet_NaN(),
        kestrel::ogc::cs::DatumEllipsoid, false, 16));
    surface->SetOutputVerticalDatum(kestrel::ogc::cs::DatumEllipsoid);
    samplecity::RpcModel model(dir + "/oblique.tif");
    const kestrel::ogc::cs::ICRS crs(options.crs);
    kestrel::processes::TorthoJob job;
    job.sourcePath = dir + "/oblique.tif";
    job.model = &model;
    job.surface = surface.get();
    job.crs = &crs;
    double west, south;
    job.geocoding = Grid(options, size, west, south);
    job.pixels = job.lines = size;
    job.orthoPath = dir + "/ours.tif";
    job.visibilityPath = dir + "/ours_visibility.tif";
    kestrel::processes::GeneratorSettings settings;
    settings.threadCount = threads;
    kestrel::processes::TorthoGenerator generator(settings);
    const auto start = Clock::now();
    const kestrel::processes::TorthoResult r = generator.Generate(job);
    std::printf("%.3f %.1f %llu %llu %llu\n", Seconds(start), benchsupport::PeakMemoryBytes() / 1e6,
                r.seen, r.hidden, r.outside);
    return r.completed ? 0 : 1;
}

std::string Capture(const std::string& command) {
    std::string out;
#if defined(_WIN32)
    FILE* pipe = _popen(command.c_str(), "r");
#else
    FILE* pipe = popen(command.c_str(), "r");
#endif
    if (pipe == nullptr)
        return out;
    char buffer[4096];
    for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;)
        out.append(buffer, n);
#if defined(_WIN32)
    _pclose(pipe);
#else
    pclose(pipe);
#endif
    return out;
}

struct Measure {
    double wall, cpu, peakMB;
};

void Compare(const std::string& self, unsigned int size) {
    const std::string dir = benchsupport::ScratchDir("generator2-" + std::to_string(size)).string();
    if (!std::filesystem::exists(dir + "/oblique.tif"))
        std::printf("%s", Capture(self + " --make " + dir + " " + std::to_string(size)).c_str());
    const samplecity::CityOptions options = samplecity::BenchCity(size);
    double west, south;
    Grid(options, size, west, south);
    const double side = size * 0.5;

    std::printf("\nimage %u x %u, DSM %.0f x %.0f at 1 m, ortho %u x %u at 0.5 m, bilinear\n", size,
                size, options.sizeX, options.sizeY, size, size);
    // Each command timed by /usr/bin/time where it exists: wall and processor seconds (the
    // machine may be shared) and peak memory.
    auto timed = [](const std::string& command, Measure& m) {
        std::string line = command;
#if !defined(_WIN32)
        const bool haveTime = std::filesystem::exists("/usr/bin/time");
        // GDAL's block cache bounded the same for both: 64 MB.
        if (haveTime)
            line = "GDAL_CACHEMAX=64 /usr/bin/time -f 'TIME %e %U %S %M' " + command + " 2>&1";
#endif
        const auto start = Clock::now();
        const std::string out = Capture(line);
        m.wall = Seconds(start);
        const size_t at = out.rfind("TIME ");
        if (at != std::string::npos) {
            std::istringstream in(out.substr(at + 5));
            double user = 0, system = 0, kb = 0;
            in >> m.wall >> user >> system >> kb;
            m.cpu = user + system, m.peakMB = kb / 1e3;
        }
        return out;
    };
    Measure one{}, two{}, warp{};
    for (unsigned int threads : {1u, 2u}) {
        Measure& m = threads == 1 ? one : two;
        std::istringstream out(timed(
            self + " --run " + dir + " " + std::to_string(size) + " " + std::to_string(threads),
            m));
        double seconds = 0, peak = 0;
        unsigned long long seen = 0, hidden = 0, outside = 0;
        out >> seconds >> peak >> seen >> hidden >> outside;
        m.peakMB = peak;
        std::printf(
            "  TorthoGenerator, %u thread%s: %7.2f s wall, %7.2f s processor, peak %6.0f MB"
            " (seen %llu, hidden %llu, outside %llu)\n",
            threads, threads > 1 ? "s" : " ", m.wall, m.cpu, m.peakMB, seen, hidden, outside);
    }
    std::ostringstream command;
    command.precision(12);
    command << "gdalwarp -q -overwrite -rpc -to RPC_DEM=" << dir << "/dsm.tif"
            << " -to RPC_DEMINTERPOLATION=bilinear -t_srs " << options.crs << " -tr 0.5 0.5 -te "
            << west << ' ' << south << ' ' << west + side << ' ' << south + side
            << " -r bilinear -et 0 -wo NUM_THREADS=1 -co TILED=YES " << dir << "/oblique.tif "
            << dir << "/gdalwarp.tif";
    timed(command.str(), warp);
    std::printf(
        "  gdalwarp -rpc -to RPC_DEM,  1 thread : %7.2f s wall, %7.2f s processor, peak %6.0f MB\n",
        warp.wall, warp.cpu, warp.peakMB);
    std::printf(
        "  TorthoGenerator / gdalwarp on 1 thread: %.2f (wall), %.2f (processor); "
        "2 threads / 1 thread wall: %.2f\n",
        one.wall / warp.wall, warp.cpu > 0 ? one.cpu / warp.cpu : 0.0,
        two.wall > 0 ? one.wall / two.wall : 0.0);
}

}  // namespace

int main(int argc, char** argv) {
    try {
        const std::string self = argv[0];
        if (argc == 4 && std::string(argv[1]) == "--make")
            return Make(argv[2], static_cast<unsigned int>(std::atoi(argv[3])));
        if (argc == 5 && std::string(argv[1]) == "--run")
            return RunOnce(argv[2], static_cast<unsigned int>(std::atoi(argv[3])),
                           static_cast<unsigned int>(std::atoi(argv[4])));
        std::vector<unsigned int> sizes;
        for (int i = 1; i < argc; ++i)
            sizes.push_back(static_cast<unsigned int>(std::atoi(argv[i])));
        if (sizes.empty())
            sizes = {2000, 4000};
        for (unsigned int size : sizes)
            Compare(self, size);
    } catch (const std::exception& e) {
        std::fprintf(stderr, "bench_generator: %s\n", e.what());
        return 1;
    }
    return 0;
}
