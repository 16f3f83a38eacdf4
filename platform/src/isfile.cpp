#include <kestrel/file.h>

#include <filesystem>
#include <system_error>

bool IsFile(const std::string& name) {
    std::error_code ec;
    return !name.empty() && std::filesystem::exists(std::filesystem::path(name), ec);
}
