// The mosaic's acceptance figures on the sample city (four oblique views of 512 x 512 pixels
// over a 480 x 480 grid of 0.5 m), each comparison side by side in one run:
//
//   exposure: images of exposures within +-20 %, mosaicked without and with colour balancing:
//     the mean brightness step across seams (per pair of scenes meeting at a seam, the mean
//     difference of their corrected values on both sides of it; weighted by seam length) and
//     the share of mosaic pixels within 15 grey levels of the mosaic of the same images at one
//     exposure, unbalanced (whose own seam step, views seeing walls and edges differently, is
//     the floor);
//   surface error: a surface model whose building edges are moved by up to a pixel, mosaicked
//     by the per-pixel choice and by seamlines: the seams on buildings, those crossing roofs and
//     of these the avoidable ones (Seams), and the share of mosaic pixels more than 15 grey
//     levels from the ideal image (the texture seen from straight above); the per-pixel choice
//     on the true surface model beside them.
//
//   bench_mosaic [--only exposure|surface] [DIR]
//     DIR: work in DIR and keep it (default: a scratch directory)
#include <kestrel/trueortho.h>
#include <samplecity.h>

#include "support.h"

#include <gdal_priv.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <tuple>
#include <utility>
#include <vector>

namespace {

using namespace kestrel::processes;
using Clock = std::chrono::steady_clock;

constexpr double kPixel = 0.5;     // the grid's pixel, the DSM's
constexpr double kTolerance = 15;  // grey levels

// A raster read whole: bands planes of width x height values.
struct Raster {
    int width = 0, height = 0, bands = 0;
    std::vector<float> values;
    float At(int band, std::size_t p) const {
        return values[static_cast<std::size_t>(band) * width * height + p];
    }
};

Raster Read(const std::string& path) {
    std::unique_ptr<GDALDataset> ds(static_cast<GDALDataset*>(GDALOpen(path.c_str(), GA_ReadOnly)));
    if (!ds) {
        std::fprintf(stderr, "bench_mosaic: cannot read %s\n", path.c_str());
        std::exit(1);
    }
    Raster r{ds->GetRasterXSize(), ds->GetRasterYSize(), ds->GetRasterCount(), {}};
    r.values.resize(static_cast<std::size_t>(r.width) * r.height * r.bands);
    if (ds->RasterIO(GF_Read, 0, 0, r.width, r.height, r.values.data(), r.width, r.height,
                     GDT_Float32, r.bands, nullptr, 0, 0, 0, nullptr) != CE_None) {
        std::fprintf(stderr, "bench_mosaic: cannot read %s\n", path.c_str());
        std::exit(1);
    }
    return r;
}

// A sample city made in its own directory, with the orthos of its images on the DSM's grid
// over the surface model `dsm` (a file of the sample).
struct City {
    std::string dir;
    samplecity::CityOptions options;
    std::unique_ptr<samplecity::GridSurface> surface;
    std::vector<std::unique_ptr<samplecity::RpcModel>> models;
    std::vector<std::string> names;

    unsigned int Size() const { return static_cast<unsigned int>(options.sizeX / kPixel); }
    kestrel::ogc::cs::GeocodingInfo Grid() const {
        return kestrel::ogc::cs::GeocodingInfo::NorthUp(options.west, options.south + options.sizeY,
                                                        kPixel, kPixel);
    }
    std::string Ortho(std::size_t s, const std::string& tag) const {
        return dir + "/" + names[s] + "_" + tag + "_ortho.tif";
    }
    std::string Visibility(std::size_t s, const std::string& tag) const {
        return dir + "/" + names[s] + "_" + tag + "_vis.tif";
    }
};

std::unique_ptr<City> MakeCity(const std::string& dir, double exposureSpread,
                               unsigned int dsmError) {
    auto city = std::make_unique<City>();
    city->dir = dir;
    city->options = samplecity::SmallCity();
    city->options.exposureSpread = exposureSpread;
    city->options.dsmError = dsmError;
    city->options.idealPixel = kPixel;
    std::filesystem::create_directories(dir);
    samplecity::MakeSample(dir, city->options);
    for (const samplecity::CameraSpec& camera : city->options.cameras) {
        city->names.push_back(camera.name);
        city->models.push_back(
            std::make_unique<samplecity::RpcModel>(dir + "/" + camera.name + ".tif"));
    }
    return city;
}

// The orthos of every image over the surface model dsmFile (of the city's directory).
void MakeOrthos(City& city, const std::string& dsmFile, const std::string& tag) {
    city.surface = std::make_unique<samplecity::GridSurface>(city.dir + "/" + dsmFile);
    const kestrel::ogc::cs::ICRS crs(city.options.crs);
    for (std::size_t s = 0; s < city.names.size(); ++s) {
        TorthoJob job;
        job.sourcePath = city.dir + "/" + city.names[s] + ".tif";
        job.model = city.models[s].get();
        job.surface = city.surface.get();
        job.crs = &crs;
        job.geocoding = city.Grid();
        job.pixels = job.lines = city.Size();
        job.orthoPath = city.Ortho(s, tag);
        job.visibilityPath = city.Visibility(s, tag);
        if (!TorthoGenerator().Generate(job).completed)
            std::exit(1);
    }
}

struct Mosaic {
    Raster values, source;
    TorthoRecoveryResult result;
    double seconds = 0;
};

// The mosaic of the city's orthos `tag`, as the workflow runs it (the sample's radiometric levels
// LOW, LOW, MODERATE, HIGH and DBM pixel error 1), with the given balance and regions.
Mosaic MakeMosaic(const City& city, const std::string& tag, RecoveryJob::Balance balance,
                  bool seamlines, const std::string& name) {
    RecoveryJob job;
    const int levels[] = {1, 1, 2, 3};
    for (std::size_t s = 0; s < city.names.size(); ++s)
        job.scenes.push_back(
            {city.Ortho(s, tag), city.Visibility(s, tag), levels[s % 4], 1, city.models[s].get()});
    job.geocoding = city.Grid();
    job.pixels = job.lines = city.Size();
    job.surface = city.surface.get();
    job.mosaicPath = city.dir + "/" + name + "_mosaic.tif";
    job.sourcePath = city.dir + "/" + name + "_source.tif";
    job.balance = balance;
    job.seamlines = seamlines;
    GeneratorSettings settings;
    settings.threadCount = 2;
    Mosaic m;
    const auto start = Clock::now();
    m.result = OcclusionRecovery(settings).Recover(job);
    m.seconds = std::chrono::duration<double>(Clock::now() - start).count();
    if (!m.result.completed)
        std::exit(1);
    m.values = Read(job.mosaicPath);
    m.source = Read(job.sourcePath);
    return m;
}

// Calls f(p, q) for each pair of 4-neighbours p, q that take different scenes.
template <class F>
void ForEachSeam(const Raster& source, F f) {
    for (int y = 0; y < source.height; ++y)
        for (int x = 0; x < source.width; ++x) {
            const std::size_t p = static_cast<std::size_t>(y) * source.width + x;
            for (const std::size_t q :
                 {x + 1 < source.width ? p + 1 : p, y + 1 < source.height ? p + source.width : p})
                if (q != p && source.values[p] > 0 && source.values[q] > 0 &&
                    source.values[p] != source.values[q])
                    f(p, q);
        }
}

// The mean brightness step across the mosaic's seams: per pair of scenes meeting at a seam, the
// mean over its seam pixels and channels of the difference between the two scenes' corrected
// values (each the mean of both sides of the seam, where the scene sees both); weighted by seam
// length. Beside it the mean absolute difference, texture and all.
std::pair<double, double> SeamStep(const City& city, const std::string& tag, const Mosaic& m) {
    std::vector<Raster> orthos, visibility;
    for (std::size_t s = 0; s < city.names.size(); ++s)
        orthos.push_back(Read(city.Ortho(s, tag))),
            visibility.push_back(Read(city.Visibility(s, tag)));
    struct Sum {
        double signedSum = 0, absolute = 0, count = 0;
    };
    std::map<std::pair<int, int>, Sum> seams;
    ForEachSeam(m.source, [&](std::size_t p, std::size_t q) {
        int a = static_cast<int>(m.source.values[p]) - 1,
            b = static_cast<int>(m.source.values[q]) - 1;
        if (a > b)
            std::swap(a, b);
        for (const int s : {a, b})
            if (visibility[s].values[p] != VISIBILITY_SEEN ||
                visibility[s].values[q] != VISIBILITY_SEEN)
                return;
        Sum& sum = seams[{a, b}];
        for (int c = 0; c < orthos[a].bands; ++c) {
            auto corrected = [&](int s, std::size_t k) {
                return m.result.gain[s][c] * orthos[s].At(c, k) + m.result.offset[s][c];
            };
            const double d =
                (corrected(a, p) + corrected(a, q)) / 2 - (corrected(b, p) + corrected(b, q)) / 2;
            sum.signedSum += d, sum.absolute += std::abs(d), sum.count += 1;
        }
    });
    double step = 0, absolute = 0, count = 0;
    for (const auto& [pair, sum] : seams)
        step += std::abs(sum.signedSum), absolute += sum.absolute, count += sum.count;
    return {step / count, absolute / count};
}

// The share of the pixels filled in both whose values differ by more than kTolerance in some
// channel.
double ShareApart(const Raster& mosaic, const Raster& mosaicSource, const Raster& other,
                  const Raster* otherSource) {
    double apart = 0, both = 0;
    const std::size_t n = static_cast<std::size_t>(mosaic.width) * mosaic.height;
    for (std::size_t p = 0; p < n; ++p) {
        if (mosaicSource.values[p] == 0 || (otherSource && otherSource->values[p] == 0))
            continue;
        both += 1;
        for (int c = 0; c < mosaic.bands; ++c)
            if (std::abs(mosaic.At(c, p) - other.At(c, p)) > kTolerance) {
                apart += 1;
                break;
            }
    }
    return apart / both;
}

// The seams (pairs of 4-neighbours that take different scenes) against the true buildings:
//   length;
//   on buildings: the share with both pixels on one building (a seam along a roof's outline
//     counts where the surface's error has put it a pixel inside);
//   inside buildings: the share with both pixels more than 1 m inside one building's outline;
//   crossings: seam pairs over a roof, both pixels farther than the surface's error (1 pixel)
//     from its outline, and the buildings they cross;
//   avoidable crossings: those over a building whose whole roof (so far from its outline) some
//     scene sees in its visibility index: that scene could take the roof whole, and the seam go
//     around it.
struct SeamFigures {
    double length = 0, onBuildings = 0, insideBuildings = 0;
    double crossings = 0, avoidable = 0;
    std::size_t crossed = 0, avoidablyCrossed = 0, buildings = 0;
};

SeamFigures Seams(const City& city, const std::string& tag, const Raster& source) {
    const samplecity::Dsm truth(city.options);  // the buildings the images show
    const int w = source.width, h = source.height;
    auto building = [&](long x, long y) {
        if (x < 0 || y < 0 || x >= w || y >= h)
            return 0;
        return truth.BuildingAt(city.options.west + (static_cast<double>(x) + 0.5) * kPixel,
                                city.options.south + city.options.sizeY -
                                    (static_cast<double>(y) + 0.5) * kPixel);
    };
    // Per pixel the building it lies on, and the building it lies on with every pixel within
    // `margin` (a square) on it too.
    const std::size_t n = static_cast<std::size_t>(w) * h;
    std::vector<int> on(n), deep(n), interior(n);
    for (std::size_t p = 0; p < n; ++p)
        on[p] = building(static_cast<long>(p % w), static_cast<long>(p / w));
    auto within = [&](int margin, std::vector<int>& out) {
        for (std::size_t p = 0; p < n; ++p) {
            const long x = static_cast<long>(p % w), y = static_cast<long>(p / w);
            out[p] = on[p];
            for (int dy = -margin; dy <= margin && out[p]; ++dy)
                for (int dx = -margin; dx <= margin && out[p]; ++dx)
                    if (building(x + dx, y + dy) != on[p])
                        out[p] = 0;
        }
    };
    within(2, deep);      // more than 1 m inside
    within(1, interior);  // farther than the surface's error
    // The buildings whose interior some scene sees whole.
    const std::size_t count = city.options.buildings.size();
    std::vector<bool> seenWhole(count + 1, false);
    for (std::size_t s = 0; s < city.names.size(); ++s) {
        const Raster vis = Read(city.Visibility(s, tag));
        std::vector<bool> whole(count + 1, true);
        for (std::size_t p = 0; p < n; ++p)
            if (interior[p] && vis.values[p] != VISIBILITY_SEEN)
                whole[static_cast<std::size_t>(interior[p])] = false;
        for (std::size_t b = 1; b <= count; ++b)
            seenWhole[b] = seenWhole[b] || whole[b];
    }
    SeamFigures f;
    std::vector<bool> crossed(count + 1, false);
    ForEachSeam(source, [&](std::size_t p, std::size_t q) {
        f.length += 1;
        f.onBuildings += on[p] != 0 && on[p] == on[q];
        f.insideBuildings += deep[p] != 0 && deep[p] == deep[q];
        if (interior[p] != 0 && interior[p] == interior[q]) {
            const auto b = static_cast<std::size_t>(interior[p]);
            f.crossings += 1;
            f.avoidable += seenWhole[b];
            crossed[b] = true;
        }
    });
    f.onBuildings /= f.length, f.insideBuildings /= f.length;
    for (std::size_t b = 1; b <= count; ++b) {
        f.crossed += crossed[b];
        f.avoidablyCrossed += crossed[b] && seenWhole[b];
        f.buildings += seenWhole[b];
    }
    return f;
}

std::string Load() {
    std::ifstream in("/proc/loadavg");
    std::string one;
    return in >> one ? one : std::string("unknown");
}

}  // namespace

int main(int argc, char** argv) {
    GDALAllRegister();
    std::string only, given;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--only" && i + 1 < argc) {
            only = argv[++i];
        } else if (arg.empty() || arg[0] == '-' || !given.empty()) {
            std::fprintf(stderr, "usage: bench_mosaic [--only exposure|surface] [DIR]\n");
            return arg == "--help" ? 0 : 2;
        } else {
            given = arg;
        }
    }
    if (!only.empty() && only != "exposure" && only != "surface") {
        std::fprintf(stderr, "bench_mosaic: --only takes exposure or surface, not %s\n",
                     only.c_str());
        return 2;
    }
    const std::string dir = !given.empty() ? given : benchsupport::ScratchDir("mosaic").string();
    std::printf("sample city, 4 views, %u hardware threads, 2 used, load %s\n",
                std::thread::hardware_concurrency(), Load().c_str());

    if (only != "surface") {
        auto reference = MakeCity(dir + "/exposure0", 0, 0);
        auto exposed = MakeCity(dir + "/exposure20", 20, 0);
        MakeOrthos(*reference, "dsm.tif", "o");
        MakeOrthos(*exposed, "dsm.tif", "o");
        const Mosaic ref =
            MakeMosaic(*reference, "o", RecoveryJob::Balance::None, true, "reference");
        std::printf("\nexposure spread 20 %%: gains");
        for (std::size_t s = 0; s < exposed->names.size(); ++s)
            std::printf(" %s %.3f", exposed->names[s].c_str(),
                        samplecity::ExposureGain(exposed->options, s));
        std::printf("\n%-26s %10s %12s %16s %8s\n", "balance", "seam step", "mean |diff|",
                    "within 15 of ref", "seconds");
        const auto [floor, floorAbsolute] = SeamStep(*reference, "o", ref);
        std::printf("%-26s %10.2f %12.2f %16s %8.2f\n", "(reference, one exposure)", floor,
                    floorAbsolute, "", ref.seconds);
        for (const auto& [label, balance] :
             {std::make_pair("none", RecoveryJob::Balance::None),
              std::make_pair("gain", RecoveryJob::Balance::Gain),
              std::make_pair("gain-offset", RecoveryJob::Balance::GainOffset)}) {
            const Mosaic m = MakeMosaic(*exposed, "o", balance, true, label);
            const auto [step, absolute] = SeamStep(*exposed, "o", m);
            std::printf("%-26s %10.2f %12.2f %15.2f%% %8.2f\n", label, step, absolute,
                        100 * (1 - ShareApart(m.values, m.source, ref.values, &ref.source)),
                        m.seconds);
            for (std::size_t s = 0;
                 s < exposed->names.size() && balance != RecoveryJob::Balance::None; ++s)
                std::printf("    %-6s gain %.3f %.3f %.3f  offset %.1f %.1f %.1f\n",
                            exposed->names[s].c_str(), m.result.gain[s][0], m.result.gain[s][1],
                            m.result.gain[s][2], m.result.offset[s][0], m.result.offset[s][1],
                            m.result.offset[s][2]);
        }
    }

    if (only != "exposure") {
        auto city = MakeCity(dir + "/dsmerror1", 0, 1);
        MakeOrthos(*city, "dsm_true.tif", "true");
        MakeOrthos(*city, "dsm.tif", "err");
        const Raster ideal = Read(city->dir + "/ideal.tif");
        if (ideal.width != static_cast<int>(city->Size()) || ideal.height != ideal.width) {
            std::fprintf(stderr, "bench_mosaic: ideal.tif is not on the grid\n");
            return 1;
        }
        std::printf("\nsurface model's building edges moved by up to 1 pixel\n");
        std::printf("%-24s %7s %10s %9s %19s %21s %11s %7s\n", "regions", "seam px",
                    "on bldgs", "inside", "crossings (bldgs)", "avoidable (of bldgs)",
                    "> 15 ideal", "seconds");
        for (const auto& [label, tag, seamlines] :
             {std::make_tuple("per pixel, true surface", "true", false),
              std::make_tuple("per pixel", "err", false),
              std::make_tuple("seamlines", "err", true)}) {
            const Mosaic m = MakeMosaic(*city, tag, RecoveryJob::Balance::GainOffset, seamlines,
                                        std::string(tag) + (seamlines ? "_seams" : "_pixel"));
            const SeamFigures seams = Seams(*city, tag, m.source);
            std::printf("%-24s %7.0f %9.2f%% %8.2f%% %12.0f (%2zu/%zu) %13.0f (%2zu/%2zu) %10.2f%% %7.2f\n",
                        label, seams.length, 100 * seams.onBuildings, 100 * seams.insideBuildings,
                        seams.crossings, seams.crossed, city->options.buildings.size(),
                        seams.avoidable, seams.avoidablyCrossed, seams.buildings,
                        100 * ShareApart(m.values, m.source, ideal, nullptr), m.seconds);
        }
    }
    if (given.empty())
        std::filesystem::remove_all(dir);
    return 0;
}
