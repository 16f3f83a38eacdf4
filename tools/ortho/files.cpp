#include "files.h"

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
    // A parameter's error names the value refused, and what was expected, when its message
    // does not.
    if (const auto* parameter = dynamic_cast<const kestrel::ParameterException*>(&error)) {
        std::string message = parameter->GetErrorMessage();
        const std::string& value = parameter->GetValue();
        const std::string shown = value.empty() ? parameter->GetParameterName() : value;
        if (!shown.empty() && message.find(shown) == std::string::npos)
            message = shown + ": " + message;
        if (!parameter->GetExpected().empty() &&
            message.find(parameter->GetExpected()) == std::string::npos)
            message += " (expected: " + parameter->GetExpected() + ")";
        return message;
    }
    const auto* file = dynamic_cast<const kestrel::FileException*>(&error);
    if (file == nullptr || file->GetFileName().empty())
        return error.what();
    std::string message = file->GetErrorMessage();
    if (message.empty())
        message = dynamic_cast<const kestrel::FileNotFoundException*>(&error) != nullptr
                      ? "not found or not readable"
                      : "cannot be used";
    // Some messages name the file already.
    if (message.find(file->GetFileName()) != std::string::npos)
        return message;
    return file->GetFileName() + ": " + message;
}

}  // namespace ortho
