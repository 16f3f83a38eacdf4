// Puts a fuzzer's input into files, for the readers and writers that take file names.
#pragma once

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <random>
#include <string>
#include <system_error>

// A directory of this process's own, so that parallel runs never share a file; on a memory file
// system where there is one, so that writing is cheap. Removed at exit.
class FuzzDir {
  public:
    static const FuzzDir& Get() {
        static const FuzzDir dir;
        return dir;
    }

    std::string Path(const std::string& name) const { return (path_ / name).string(); }

    std::string Write(const std::string& name, const uint8_t* data, size_t size) const {
        const std::string path = Path(name);
        std::FILE* file = std::fopen(path.c_str(), "wb");
        if (file == nullptr)
            std::abort();
        if (size > 0 && std::fwrite(data, 1, size, file) != size)
            std::abort();
        std::fclose(file);
        return path;
    }

    ~FuzzDir() {
        std::error_code ec;
        std::filesystem::remove_all(path_, ec);
    }

  private:
    FuzzDir() {
        std::error_code ec;
        std::filesystem::path base = "/dev/shm";
        if (!std::filesystem::is_directory(base, ec))
            base = std::filesystem::temp_directory_path();
        std::random_device random;
        do {
            path_ = base / ("silvan-fuzz-" + std::to_string(random()) + std::to_string(random()));
        } while (!std::filesystem::create_directory(path_, ec));
    }

    std::filesystem::path path_;
};

// A broken expectation: stops the run so that the fuzzer keeps the input.
#define FUZZ_EXPECT(condition)                                                            \
    do {                                                                                  \
        if (!(condition)) {                                                               \
            std::fprintf(stderr, "%s:%d: expected %s\n", __FILE__, __LINE__, #condition); \
            std::abort();                                                                 \
        }                                                                                 \
    } while (0)
