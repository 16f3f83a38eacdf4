// The true-ortho generator on synthetic towns: an RPC image of N x N pixels over a 1 m DSM with
// buildings of 6 to 40 m, bilinear, onto a grid at 0.5 m. Two scenes:
//
//   centre   seen 20 degrees off nadir; the central N x N pixels of the grid;
//   oblique  seen 30 degrees off nadir; the whole footprint, on the grid that silvan-ortho
//            works out for it (the hard case).
//
// Processor and wall time, output megapixels per second and peak memory on 1 and 2 threads,
// next to gdalwarp with the RPC transformer on the DSM, which makes the same grid without
// detecting occlusions; for the oblique scene also the whole silvan-ortho run (layout, ortho,
// visibility, footprint, scene description, recovery, quicklooks). Each run is a child process
// of its own so that its peak memory is its own; all run with GDAL's block cache at 64 MB
// (GDAL_CACHEMAX) and the DSM is read through the platform's file DEM with its 16 MB block
// cache. Every run is repeated (--repeat N, default 3) and the median and range are shown.
//
//   bench_generator [--repeat N] [centre|oblique] [SIZE ...]   default: both scenes, 2000
//   bench_generator --make DIR SCENE SIZE            (internal) writes the town
//   bench_generator --run DIR THREADS [ERROR]        (internal) one generator run on DIR/grid.txt
//   bench_generator --compare ORTHO VIS ORTHO2 VIS2  how far two runs' outputs differ
#include <kestrel/dem.h>
#include <kestrel/trueortho.h>
#include <samplecity.h>

#include "support.h"

#include <gdal_priv.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <limits>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;

double Seconds(Clock::time_point since) {
    return std::chrono::duration<double>(Clock::now() - since).count();
}

samplecity::CityOptions SceneOptions(const std::string& scene, unsigned int size) {
    if (scene == "centre")
        return samplecity::BenchCity(size);
    // 30 degrees off nadir and turned by 20 degrees, the footprint's corners reach about 0.8
    // image widths from the centre on the ground: a DSM 1.8 times as wide covers it.
    samplecity::CityOptions o = samplecity::BenchCity(size * 3 / 2);
    o.cameras = {{"oblique", 20.0, 30.0, 2500.0, size, size, 0.5}};
    return o;
}

// The output grid: EPSG code, geotransform and size, in DIR/grid.txt.
struct Grid {
    std::string crs;
    double gt[6] = {0, 0.5, 0, 0, 0, -0.5};
    unsigned int pixels = 0, lines = 0;
};

void SaveGrid(const std::string& dir, const Grid& g) {
    std::ofstream out(dir + "/grid.txt");
    out.precision(17);
    out << g.crs << ' ' << g.pixels << ' ' << g.lines;
    for (double v : g.gt)
        out << ' ' << v;
    out << '\n';
}

Grid LoadGrid(const std::string& dir) {
    Grid g;
    std::ifstream in(dir + "/grid.txt");
    in >> g.crs >> g.pixels >> g.lines;
    for (double& v : g.gt)
        in >> v;
    if (!in)
        throw std::runtime_error(dir + "/grid.txt cannot be read");
    return g;
}

// The central N x N pixels at 0.5 m of the town.
Grid CentreGrid(const samplecity::CityOptions& o, unsigned int size) {
    const double side = size * 0.5;
    Grid g;
    g.crs = o.crs;
    g.gt[0] = o.west + (o.sizeX - side) / 2, g.gt[3] = o.south + (o.sizeY - side) / 2 + side;
    g.pixels = g.lines = size;
    return g;
}

// The grid of a raster that silvan-ortho wrote.
Grid RasterGrid(const std::string& path, const std::string& crs) {
    GDALAllRegister();
    std::unique_ptr<GDALDataset> ds(
        GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
    if (!ds)
        throw std::runtime_error(path + " cannot be opened");
    Grid g;
    g.crs = crs;
    ds->GetGeoTransform(g.gt);
    g.pixels = static_cast<unsigned int>(ds->GetRasterXSize());
    g.lines = static_cast<unsigned int>(ds->GetRasterYSize());
    return g;
}

int Make(const std::string& dir, const std::string& scene, unsigned int size) {
    std::filesystem::create_directories(dir);
    const auto start = Clock::now();
    const samplecity::Sample sample = samplecity::MakeSample(dir, SceneOptions(scene, size));
    std::printf("town of %u x %u pixels made in %.1f s (RPC fit within %.4f px)\n", size, size,
                Seconds(start), sample.images[0].rpcMaxResidual);
    return 0;
}

int RunOnce(const std::string& dir, unsigned int threads, double maxError) {
    const Grid grid = LoadGrid(dir);
    // The platform's file DEM, read through its bounded block cache (16 MB).
    std::unique_ptr<kestrel::dem::IRasterDEM> surface(kestrel::dem::DEMFactory::CreateFileRasterDEM(
        dir + "/dsm.tif", 1, 0.0, 1.0, std::numeric_limits<float>::quiet_NaN(),
        kestrel::ogc::cs::DatumEllipsoid, false, 16));
    surface->SetOutputVerticalDatum(kestrel::ogc::cs::DatumEllipsoid);
    samplecity::RpcModel model(dir + "/oblique.tif");
    const kestrel::ogc::cs::ICRS crs(grid.crs);
    kestrel::processes::TorthoJob job;
    job.sourcePath = dir + "/oblique.tif";
    job.model = &model;
    job.surface = surface.get();
    job.crs = &crs;
    job.geocoding = kestrel::ogc::cs::GeocodingInfo::NorthUp(grid.gt[0], grid.gt[3], grid.gt[1],
                                                            -grid.gt[5]);
    job.pixels = grid.pixels, job.lines = grid.lines;
    job.orthoPath = dir + "/ours.tif";
    job.visibilityPath = dir + "/ours_visibility.tif";
    if (maxError >= 0)
        job.errorThreshold = maxError;
    kestrel::processes::GeneratorSettings settings;
    settings.threadCount = threads;
    kestrel::processes::TorthoGenerator generator(settings);
    const auto start = Clock::now();
    const kestrel::processes::TorthoResult r = generator.Generate(job);
    std::printf("%.3f %.1f %llu %llu %llu\n", Seconds(start), benchsupport::PeakMemoryBytes() / 1e6,
                r.seen, r.hidden, r.outside);
    return r.completed ? 0 : 1;
}

// Reads every band of a raster as Float32, band after band.
std::vector<float> ReadAll(const std::string& path, int& width, int& height, int& bands) {
    GDALAllRegister();
    std::unique_ptr<GDALDataset> ds(
        GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
    if (!ds)
        throw std::runtime_error(path + " cannot be opened");
    width = ds->GetRasterXSize(), height = ds->GetRasterYSize(), bands = ds->GetRasterCount();
    std::vector<float> values(static_cast<size_t>(width) * height * bands);
    if (ds->RasterIO(GF_Read, 0, 0, width, height, values.data(), width, height, GDT_Float32,
                     bands, nullptr, 0, 0, 0, nullptr) != CE_None)
        throw std::runtime_error(path + " cannot be read");
    return values;
}

// The share of pixels whose every band lies within 1 grey level of the other run's, and of
// pixels whose visibility differs.
int CompareRuns(const std::string& ortho, const std::string& vis, const std::string& ortho2,
                const std::string& vis2) {
    int w, h, b, w2, h2, b2, wv, hv, bv;
    const std::vector<float> a = ReadAll(ortho, w, h, b), a2 = ReadAll(ortho2, w2, h2, b2);
    const std::vector<float> v = ReadAll(vis, wv, hv, bv), v2 = ReadAll(vis2, w2, h2, b2);
    if (a.size() != a2.size() || v.size() != v2.size() || v.size() != static_cast<size_t>(w) * h)
        throw std::runtime_error("the rasters differ in size");
    const size_t n = v.size();
    size_t within = 0, visibility = 0, seenBoth = 0, seenWithin = 0;
    double largest = 0;
    for (size_t k = 0; k < n; ++k) {
        double d = 0;
        for (int c = 0; c < b; ++c)
            d = std::max(d, static_cast<double>(std::fabs(a[c * n + k] - a2[c * n + k])));
        largest = std::max(largest, d);
        within += d <= 1;
        visibility += v[k] != v2[k];
        if (v[k] == 1 && v2[k] == 1)
            ++seenBoth, seenWithin += d <= 1;
    }
    std::printf("%zu pixels: %.4f %% within 1 grey level in every band (largest difference %.0f; "
                "%.4f %% of the pixels seen in both), visibility differs on %.4f %% (%zu)\n",
                n, 100.0 * within / n, largest, 100.0 * seenWithin / std::max<size_t>(seenBoth, 1),
                100.0 * visibility / n, visibility);
    return 0;
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
    double wall = 0, cpu = 0, peakMB = 0;
};

// Runs a command, timed by /usr/bin/time where it exists: wall and processor seconds (the machine
// may be shared) and peak memory. GDAL's block cache is bounded the same for every run: 64 MB.
std::string Timed(const std::string& command, Measure& m) {
    std::string line = command;
#if !defined(_WIN32)
    if (std::filesystem::exists("/usr/bin/time"))
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
}

// Repeated runs of one command: the median and the range of each figure.
struct Series {
    std::vector<Measure> runs;
    static double Median(std::vector<double> v) {
        std::sort(v.begin(), v.end());
        return v.empty() ? 0 : v.size() % 2 ? v[v.size() / 2]
                                            : (v[v.size() / 2 - 1] + v[v.size() / 2]) / 2;
    }
    std::vector<double> Of(double Measure::*field) const {
        std::vector<double> v;
        for (const Measure& m : runs)
            v.push_back(m.*field);
        return v;
    }
    double Wall() const { return Median(Of(&Measure::wall)); }
    double Cpu() const { return Median(Of(&Measure::cpu)); }
    double Peak() const { return Median(Of(&Measure::peakMB)); }
    std::string Range(double Measure::*field) const {
        const std::vector<double> v = Of(field);
        char text[64];
        std::snprintf(text, sizeof text, "%.2f-%.2f", *std::min_element(v.begin(), v.end()),
                      *std::max_element(v.begin(), v.end()));
        return text;
    }
};

void Print(const char* name, const Series& s, double megapixels) {
    std::printf("  %-34s %7.2f s wall (%s), %7.2f s processor (%s), %5.2f Mpx/s of processor, "
                "peak %5.0f MB\n",
                name, s.Wall(), s.Range(&Measure::wall).c_str(), s.Cpu(),
                s.Range(&Measure::cpu).c_str(), megapixels / s.Cpu(), s.Peak());
}

std::string Directory(const std::string& self) {
    return std::filesystem::absolute(std::filesystem::path(self)).parent_path().string();
}

void Compare(const std::string& self, const std::string& scene, unsigned int size, int repeat) {
    const std::string dir =
        benchsupport::ScratchDir("generator3-" + scene + "-" + std::to_string(size)).string();
    if (!std::filesystem::exists(dir + "/oblique.tif"))
        std::printf("%s",
                    Capture(self + " --make " + dir + " " + scene + " " + std::to_string(size))
                        .c_str());
    const samplecity::CityOptions options = SceneOptions(scene, size);

    // The whole workflow, for the oblique scene; its ortho's grid is the grid of the others.
    const std::string ortho = Directory(self) + "/../tools/silvan-ortho";
    Series workflow[2];
    Grid grid = CentreGrid(options, size);
    if (scene == "oblique") {
        for (int k = 0; k < repeat; ++k)
            for (unsigned int threads : {1u, 2u}) {
                std::filesystem::remove_all(dir + "/workflow");
                Measure m;
                const std::string out =
                    Timed(ortho + " " + dir + "/master.txt --out " + dir + "/workflow --dem " +
                              dir + "/dsm.tif --elevref ELLIPS --pixel-size 0.5 --srs " +
                              options.crs +
                              " --quiet --proc CPU:" + std::to_string(threads),
                          m);
                if (!std::filesystem::exists(dir + "/workflow/oblique_ortho.tif"))
                    throw std::runtime_error("silvan-ortho failed: " + out);
                workflow[threads - 1].runs.push_back(m);
            }
        grid = RasterGrid(dir + "/workflow/oblique_ortho.tif", options.crs);
    }
    SaveGrid(dir, grid);
    const double megapixels = grid.pixels * static_cast<double>(grid.lines) / 1e6;
    std::printf("\n%s: image %u x %u seen %.0f degrees off nadir, DSM %.0f x %.0f at 1 m, ortho "
                "%u x %u at 0.5 m (%.2f Mpx), bilinear; median (range) of %d runs\n",
                scene.c_str(), size, size, options.cameras[0].offNadirDegrees, options.sizeX,
                options.sizeY, grid.pixels, grid.lines, megapixels, repeat);

    Series ours[2], warp;
    std::ostringstream command;
    command.precision(12);
    command << "gdalwarp -q -overwrite -rpc -to RPC_DEM=" << dir << "/dsm.tif"
            << " -to RPC_DEMINTERPOLATION=bilinear -t_srs " << options.crs << " -tr "
            << grid.gt[1] << ' ' << -grid.gt[5] << " -te " << grid.gt[0] << ' '
            << grid.gt[3] + grid.lines * grid.gt[5] << ' ' << grid.gt[0] + grid.pixels * grid.gt[1]
            << ' ' << grid.gt[3] << " -r bilinear -et 0 -wo NUM_THREADS=1 -co TILED=YES " << dir
            << "/oblique.tif " << dir << "/gdalwarp.tif";
    unsigned long long seen = 0, hidden = 0, outside = 0;
    for (int k = 0; k < repeat; ++k) {
        for (unsigned int threads : {1u, 2u}) {
            Measure m;
            std::istringstream out(
                Timed(self + " --run " + dir + " " + std::to_string(threads), m));
            double seconds = 0, peak = 0;
            out >> seconds >> peak >> seen >> hidden >> outside;
            m.peakMB = peak;
            ours[threads - 1].runs.push_back(m);
        }
        Measure m;
        Timed(command.str(), m);
        warp.runs.push_back(m);
    }
    Print("TorthoGenerator, 1 thread", ours[0], megapixels);
    Print("TorthoGenerator, 2 threads", ours[1], megapixels);
    Print("gdalwarp -rpc -to RPC_DEM, 1 thread", warp, megapixels);
    if (!workflow[0].runs.empty()) {
        Print("silvan-ortho, whole run, CPU:1", workflow[0], megapixels);
        Print("silvan-ortho, whole run, CPU:2", workflow[1], megapixels);
    }
    std::printf("  (seen %llu, hidden %llu, outside %llu)\n", seen, hidden, outside);
    std::printf("  generator / gdalwarp processor time, 1 thread: %.2f; 2 threads / 1 thread "
                "wall: %.2f",
                ours[0].Cpu() / warp.Cpu(), ours[1].Wall() / ours[0].Wall());
    if (!workflow[0].runs.empty())
        std::printf("; silvan-ortho CPU:1 / gdalwarp processor time: %.2f",
                    workflow[0].Cpu() / warp.Cpu());
    std::printf("\n");
}

}  // namespace

int main(int argc, char** argv) {
    try {
        const std::string self = argv[0];
        if (argc == 5 && std::string(argv[1]) == "--make")
            return Make(argv[2], argv[3], static_cast<unsigned int>(std::atoi(argv[4])));
        if (argc == 6 && std::string(argv[1]) == "--compare")
            return CompareRuns(argv[2], argv[3], argv[4], argv[5]);
        if ((argc == 4 || argc == 5) && std::string(argv[1]) == "--run")
            return RunOnce(argv[2], static_cast<unsigned int>(std::atoi(argv[3])),
                           argc == 5 ? std::atof(argv[4]) : -1.0);
        int repeat = 3;
        std::vector<std::string> scenes;
        std::vector<unsigned int> sizes;
        for (int i = 1; i < argc; ++i) {
            const std::string a = argv[i];
            if (a == "--repeat" && i + 1 < argc)
                repeat = std::max(1, std::atoi(argv[++i]));
            else if (a == "centre" || a == "oblique")
                scenes.push_back(a);
            else
                sizes.push_back(static_cast<unsigned int>(std::atoi(argv[i])));
        }
        if (scenes.empty())
            scenes = {"oblique", "centre"};
        if (sizes.empty())
            sizes = {2000};
        for (const std::string& scene : scenes)
            for (unsigned int size : sizes)
                Compare(self, scene, size, repeat);
    } catch (const std::exception& e) {
        std::fprintf(stderr, "bench_generator: %s\n", e.what());
        return 1;
    }
    return 0;
}
