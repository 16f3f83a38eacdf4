// Helpers shared by the benchmarks: peak memory and scratch files.
#pragma once

#include <cstdint>
#include <filesystem>
#include <string>

#if defined(_WIN32)
#define WIN32_LEAN_AND_MEAN
#include <psapi.h>
#include <windows.h>
#else
#include <sys/resource.h>
#endif

namespace benchsupport {

// Peak resident memory of this process so far, in bytes.
inline std::uint64_t PeakMemoryBytes() {
#if defined(_WIN32)
    PROCESS_MEMORY_COUNTERS counters{};
    GetProcessMemoryInfo(GetCurrentProcess(), &counters, sizeof counters);
    return counters.PeakWorkingSetSize;
#else
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    return static_cast<std::uint64_t>(usage.ru_maxrss) * 1024u;
#endif
}

// A scratch directory for generated input, kept between runs of the same program so that
// large files are generated once.
inline std::filesystem::path ScratchDir(const std::string& name) {
    const auto dir = std::filesystem::temp_directory_path() / ("silvan-bench-" + name);
    std::filesystem::create_directories(dir);
    return dir;
}

}  // namespace benchsupport
