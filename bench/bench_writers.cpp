// Writing the preparation parameter file and the image-set file from the 1,000,000-line
// master file: read once, then each writer on its own.
#include <silvan/tomfileparser.h>

#include <benchmark/benchmark.h>

#include "masterfile.h"

namespace {

using kestrel::processes::silvan::TOMFileParser;

void WriteMFilePrep(benchmark::State& state) {
    TOMFileParser master(benchsupport::MasterFile());
    const std::string out = (benchsupport::ScratchDir("mfile") / "prep.txt").string();
    for (auto _ : state)
        master.WriteMFilePrep(out);
    state.SetItemsProcessed(state.iterations() * master.GetMfileLines());
    state.counters["peak_MB"] = benchsupport::PeakMemoryBytes() / 1e6;
}

void WriteImgSet(benchmark::State& state) {
    TOMFileParser master(benchsupport::MasterFile());
    const std::string out = (benchsupport::ScratchDir("mfile") / "imgset.txt").string();
    for (auto _ : state)
        master.WriteImgSet(out);
    state.SetItemsProcessed(state.iterations() * master.GetMfileLines());
    state.counters["peak_MB"] = benchsupport::PeakMemoryBytes() / 1e6;
}

// The whole job as a process does it: read the master file, write both derived files.
void ReadAndWriteBoth(benchmark::State& state) {
    const std::string path = benchsupport::MasterFile();
    const auto dir = benchsupport::ScratchDir("mfile");
    for (auto _ : state) {
        TOMFileParser master(path);
        master.WriteMFilePrep((dir / "prep.txt").string());
        master.WriteImgSet((dir / "imgset.txt").string());
    }
    state.counters["peak_MB"] = benchsupport::PeakMemoryBytes() / 1e6;
}

}  // namespace

BENCHMARK(WriteMFilePrep)->Unit(benchmark::kMillisecond);
BENCHMARK(WriteImgSet)->Unit(benchmark::kMillisecond);
BENCHMARK(ReadAndWriteBoth)->Unit(benchmark::kMillisecond);
BENCHMARK_MAIN();
