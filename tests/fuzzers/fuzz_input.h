// Puts a fuzzer's input into a file, for the readers that take file names.
#pragma once

#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <string>

inline std::string FuzzInputFile(const uint8_t* data, size_t size, const char* name) {
    static const std::string path =
        (std::filesystem::temp_directory_path() / (std::string("silvan-fuzz-") + name)).string();
    std::FILE* file = std::fopen(path.c_str(), "wb");
    if (file == nullptr)
        std::abort();
    std::fwrite(data, 1, size, file);
    std::fclose(file);
    return path;
}
