#include <kestrel/file.h>

#include <filesystem>
#include <system_error>

namespace kestrel {
namespace core {
namespace fileio {

namespace fs = std::filesystem;

File::File(const std::string& name) : name_(name) {}
File::File(const char* name) : name_(name != nullptr ? name : "") {}

std::string File::GetBasename() const {
    const std::string::size_type sep = name_.find_last_of("/\\");
    return sep == std::string::npos ? name_ : name_.substr(sep + 1);
}

std::string File::GetNormalizedName() const {
    if (name_.empty())
        return name_;
    fs::path normal = fs::path(name_).lexically_normal();
    normal.make_preferred();
    return normal.string();
}

std::string File::GetAbsolutePath() const {
    std::error_code ec;
    fs::path absolute = fs::absolute(fs::path(name_), ec);
    if (ec)
        absolute = fs::path(name_);
    fs::path directory = absolute.lexically_normal().parent_path();
    directory.make_preferred();
    std::string text = directory.string();
    if (text.empty() || (text.back() != '/' && text.back() != '\\')) {
        text += static_cast<char>(fs::path::preferred_separator);
    }
    return text;
}

bool File::Exists() const {
    std::error_code ec;
    return !name_.empty() && fs::exists(fs::path(name_), ec);
}

}  // namespace fileio
}  // namespace core
}  // namespace kestrel
