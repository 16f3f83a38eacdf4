// Scene description files: writing and reading back 10,000 scenes of 50 vertices, against an
// independent parser (xmllint) reading the same files.
#include <benchmark/benchmark.h>

#include "support.h"

#include <silvan/tosceneparser.h>

#include <chrono>
#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

using kestrel::processes::silvan::TOSceneParser;

namespace {

constexpr int kFiles = 10000;
constexpr unsigned int kVertices = 50;

std::string SceneDir() {
    return benchsupport::ScratchDir("scene").string();
}

std::string ScenePath(int index) {
    return SceneDir() + "/scene" + std::to_string(index) + ".xml";
}

// A footprint of 50 vertices on a circle around a UTM-like position.
kestrel::tin::Polygon<double> Footprint(int index) {
    auto* points = new point2_t<double>[kVertices];
    for (unsigned int k = 0; k < kVertices; ++k) {
        const double angle = 2.0 * 3.141592653589793 * k / kVertices;
        points[k].x = 500000.0 + index + 1234.5678 * std::cos(angle);
        points[k].y = 4100000.0 + index + 987.654321 * std::sin(angle);
    }
    return kestrel::tin::Polygon<double>(points, kVertices);
}

void WriteScene(int index, const kestrel::tin::Polygon<double>& footprint) {
    TOSceneParser scene;
    scene.SetSceneFilename("/data/src/image_" + std::to_string(index) + ".tif");
    scene.SetOrthoFilename("/data/ortho/ortho_" + std::to_string(index) + ".tif");
    scene.SetVisIdxFilename("/data/vis/vis_" + std::to_string(index) + ".tif");
    scene.SetElevMapFilename("/data/dem/elev_" + std::to_string(index) + ".tif");
    scene.SetMmseg(2);
    scene.SetOrthoNoDataValue(0.0f);
    scene.SetElevNoDataValue(-32768.0f);
    scene.SetSceneFootprint(&footprint);
    scene.SetXMLFilename(ScenePath(index));
    scene.Serialize(false);
}

unsigned int ReadScene(int index) {
    TOSceneParser scene(ScenePath(index).c_str());
    return scene.GetSceneFootprint()->numPoints;
}

void SetMemoryCounter(benchmark::State& state) {
    state.counters["peak_MiB"] =
        static_cast<double>(benchsupport::PeakMemoryBytes()) / (1024.0 * 1024.0);
}

// The whole task once: write all files, then read all back; time per file written and read.
// With keepXerces, one parser object stays alive so that the XML library is not started and
// stopped for each file.
void BM_WriteThenRead10000(benchmark::State& state) {
    const bool keepXerces = state.range(0) != 0;
    std::vector<kestrel::tin::Polygon<double>> footprints;
    footprints.reserve(kFiles);
    for (int i = 0; i < kFiles; ++i)
        footprints.push_back(Footprint(i));
    for (auto _ : state) {
        std::unique_ptr<TOSceneParser> keeper(keepXerces ? new TOSceneParser : nullptr);
        const auto start = std::chrono::steady_clock::now();
        for (int i = 0; i < kFiles; ++i)
            WriteScene(i, footprints[i]);
        const auto written = std::chrono::steady_clock::now();
        unsigned long long vertices = 0;
        for (int i = 0; i < kFiles; ++i)
            vertices += ReadScene(i);
        const auto read = std::chrono::steady_clock::now();
        if (vertices != static_cast<unsigned long long>(kFiles) * kVertices) {
            state.SkipWithError("a scene read back with the wrong number of vertices");
        }
        using us = std::chrono::duration<double, std::micro>;
        state.counters["write_us_per_file"] = us(written - start).count() / kFiles;
        state.counters["read_us_per_file"] = us(read - written).count() / kFiles;
        state.counters["both_us_per_file"] = us(read - start).count() / kFiles;
    }
    SetMemoryCounter(state);
}
BENCHMARK(BM_WriteThenRead10000)
    ->Arg(0)
    ->Arg(1)
    ->Iterations(1)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

// xmllint parsing the same 10,000 files (one process for all), for comparison with reading.
void BM_XmllintNoout10000(benchmark::State& state) {
    if (std::system("xmllint --version > /dev/null 2>&1") != 0) {
        state.SkipWithError("xmllint is not installed");
        return;
    }
    // The files of the run above; made here when this benchmark runs alone.
    for (int i = 0; i < kFiles; ++i) {
        if (!std::filesystem::exists(ScenePath(i)))
            WriteScene(i, Footprint(i));
    }
    const std::string command =
        "cd " + SceneDir() + " && find . -name 'scene*.xml' -print0 | xargs -0 xmllint --noout";
    for (auto _ : state) {
        const auto start = std::chrono::steady_clock::now();
        const int rc = std::system(command.c_str());
        const auto end = std::chrono::steady_clock::now();
        if (rc != 0)
            state.SkipWithError("xmllint failed");
        state.counters["read_us_per_file"] =
            std::chrono::duration<double, std::micro>(end - start).count() / kFiles;
    }
}
BENCHMARK(BM_XmllintNoout10000)->Iterations(1)->Unit(benchmark::kMillisecond)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
