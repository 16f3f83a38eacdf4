// Ground-to-image throughput of the frame-camera model next to the RPC model fitted to the same
// camera, on batches of 4096 points (one 64 x 64 tile of an ortho) over the sample city. The
// camera takes its ground in its CRS (UTM 32N, as the ortho's grid is), the RPC model in WGS 84
// longitude and latitude; each side also runs with the ortho grid's points taken to its CRS
// first, as the generator does when the two differ.
#include <benchmark/benchmark.h>

#include <memory>
#include <random>
#include <string>
#include <vector>

#include <kestrel/crs.h>
#include <kestrel/mathmodel.h>
#include <kestrel/orthoutils.h>
#include <samplecity.h>

#include "support.h"

namespace {

constexpr std::size_t kBatch = 4096;

struct Scene {
    std::unique_ptr<kestrel::mathmodel::IMathModel> camera, rpc;
    std::vector<double> x, y, h;  // UTM 32N and ellipsoidal heights
    std::vector<double> lon, lat;

    Scene() {
        const std::string dir = benchsupport::ScratchDir("camera").string();
        samplecity::CityOptions options = samplecity::SmallCity();
        options.cameras.resize(1);
        options.cameras[0].width = options.cameras[0].height = 256;
        const samplecity::Sample sample = samplecity::MakeSample(dir, options, 1);
        camera.reset(GetSrcModel(sample.images[0].path, "", 4));
        rpc.reset(GetSrcModel(sample.images[0].path, "", 1));
        std::mt19937 random(3);
        std::uniform_real_distribution<double> u(0.0, 1.0);
        for (std::size_t i = 0; i < kBatch; ++i) {
            x.push_back(options.west + 240 * u(random));
            y.push_back(options.south + 240 * u(random));
            h.push_back(250 + 30 * u(random));
        }
        lon = x, lat = y;
        kestrel::ogc::cs::CoordinateTransformation(kestrel::ogc::cs::ICRS(options.crs),
                                                   kestrel::ogc::cs::ICRS("EPSG:4326"))
            .Transform(kBatch, lon.data(), lat.data());
    }
};

const Scene& TheScene() {
    static const Scene scene;
    return scene;
}

// model: 0 the camera, 1 the RPCs; fromGrid: the points come in the other model's CRS and are
// transformed first.
void GroundToImage(benchmark::State& state) {
    const Scene& s = TheScene();
    const bool isCamera = state.range(0) == 0, fromGrid = state.range(1) != 0;
    const kestrel::mathmodel::IMathModel& model = isCamera ? *s.camera : *s.rpc;
    std::unique_ptr<kestrel::ogc::cs::CoordinateTransformation> toModel;
    if (fromGrid) {
        toModel = std::make_unique<kestrel::ogc::cs::CoordinateTransformation>(
            kestrel::ogc::cs::ICRS(isCamera ? "EPSG:4326" : "EPSG:32632"), *model.GetCRS());
    }
    const std::vector<double>& inX = isCamera != fromGrid ? s.x : s.lon;
    const std::vector<double>& inY = isCamera != fromGrid ? s.y : s.lat;
    std::vector<double> x(kBatch), y(kBatch), col(kBatch), row(kBatch);
    std::unique_ptr<bool[]> ok(new bool[kBatch]);
    for (auto _ : state) {
        x = inX, y = inY;
        if (toModel)
            toModel->Transform(kBatch, x.data(), y.data());
        model.GroundToImage(kBatch, x.data(), y.data(), s.h.data(), col.data(), row.data(),
                            ok.get());
        benchmark::DoNotOptimize(col.data());
    }
    state.SetItemsProcessed(state.iterations() * static_cast<std::int64_t>(kBatch));
    state.SetLabel(std::string(isCamera ? "camera" : "rpc") +
                   (fromGrid ? (isCamera ? ", from lon/lat" : ", from UTM") : ", own CRS"));
}

}  // namespace

BENCHMARK(GroundToImage)
    ->ArgsProduct({{0, 1}, {0, 1}})
    ->ArgNames({"model", "fromGrid"})
    ->Unit(benchmark::kMicrosecond);

BENCHMARK_MAIN();
