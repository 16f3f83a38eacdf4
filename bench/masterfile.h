// A generated master parameter file of 1,000,000 lines and 9 columns, shared by benchmarks.
#pragma once

#include "support.h"

#include <cstdio>
#include <filesystem>
#include <string>

namespace benchsupport {

constexpr int kMasterLines = 1000000;

// Writes the file once and returns its path.
inline std::string MasterFile() {
    const auto path = ScratchDir("mfile") / "master_1m.txt";
    if (std::filesystem::exists(path))
        return path.string();
    const std::string tmp = path.string() + ".tmp";
    std::FILE* out = std::fopen(tmp.c_str(), "wb");
    std::fputs("!MFILE master parameter file\n", out);
    static const char* const roles[] = {"fill", "prep", "FILL", ""};
    static const char* const levels[] = {"low", "moderate", "high", "any"};
    for (int i = 0; i < kMasterLines; ++i) {
        std::fprintf(out, "/data/block%02d/scene_%07d.tif;1,2,3;%d;%d,%d;0;%d;%s;%d;%s\n", i % 97,
                     i, 2 + i % 5, i % 11, 16, i % 3, levels[i % 4], i % 7, roles[i % 4]);
    }
    std::fclose(out);
    std::filesystem::rename(tmp, path);
    return path.string();
}

}  // namespace benchsupport
