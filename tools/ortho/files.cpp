#include "files.h"

#include "../message.h"

#include <kestrel/rasterio.h>

#include <chrono>
#include <filesystem>
#include <limits>
#include <system_error>

#ifdef _WIN32
#include <process.h>
#else
#include <unistd.h>
#endif

namespace fs = std::filesystem;

namespace ortho {

std::string PartName(const std::string& path) {
    const fs::path p(path);
    return (p.parent_path() / (p.stem().string() + ".part" + p.extension().string())).string();
}

std::string UniquePartName(const std::string& path) {
#ifdef _WIN32
    const long long pid = _getpid();
#else
    const long long pid = getpid();
#endif
    return PartName(path) + "." + std::to_string(pid);
}

void Publish(const std::string& part, const std::string& path) {
    kestrel::datasources::PublishDataset(part, path);
}

bool FileExists(const std::string& path) {
    std::error_code ec;
    return fs::exists(path, ec);
}

void RemoveFile(const std::string& path) {
    std::error_code ec;
    fs::remove(path, ec);
}

double ModifiedTime(const std::string& path) {
    std::error_code ec;
    const auto time = fs::last_write_time(path, ec);
    if (ec)
        return -std::numeric_limits<double>::infinity();
    return std::chrono::duration<double>(time.time_since_epoch()).count();
}

std::string Explain(const std::exception& error) {
    return tools::UserMessage(error);
}

}  // namespace ortho
