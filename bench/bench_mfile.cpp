// Reading a master-style parameter file of 1,000,000 lines and 9 columns through the table
// reader: the read alone, and the read followed by every field as text.
#include <kestrel/mfileparser.h>

#include <benchmark/benchmark.h>

#include "masterfile.h"

#include <filesystem>
#include <memory>

namespace {

void ReadTable(benchmark::State& state) {
    const std::string path = benchsupport::MasterFile();
    for (auto _ : state) {
        kestrel::MFileParser reader(0);
        std::unique_ptr<kestrel::ParametersTableIF> table(reader.Create(path));
        benchmark::DoNotOptimize(table->GetLineCount());
    }
    state.SetBytesProcessed(state.iterations() *
                            static_cast<int64_t>(std::filesystem::file_size(path)));
    state.counters["file_MB"] = std::filesystem::file_size(path) / 1e6;
    state.counters["peak_MB"] = benchsupport::PeakMemoryBytes() / 1e6;
}

void ReadTableAndEveryField(benchmark::State& state) {
    const std::string path = benchsupport::MasterFile();
    for (auto _ : state) {
        kestrel::MFileParser reader(0);
        std::unique_ptr<kestrel::ParametersTableIF> table(reader.Create(path));
        for (int column = 0; column < 9; ++column)
            table->AddDefaultString("");
        std::size_t bytes = 0;
        const int lines = static_cast<int>(table->GetLineCount());
        for (int line = 0; line < lines; ++line) {
            for (int column = 0; column < 9; ++column) {
                bytes += table->GetString(line, column).size();
            }
        }
        benchmark::DoNotOptimize(bytes);
    }
    state.SetBytesProcessed(state.iterations() *
                            static_cast<int64_t>(std::filesystem::file_size(path)));
    state.counters["peak_MB"] = benchsupport::PeakMemoryBytes() / 1e6;
}

}  // namespace

BENCHMARK(ReadTable)->Unit(benchmark::kMillisecond);
BENCHMARK(ReadTableAndEveryField)->Unit(benchmark::kMillisecond);
BENCHMARK_MAIN();
