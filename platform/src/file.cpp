#include <kestrel/file.h>

#include <atomic>
#include <cerrno>
#include <filesystem>
#include <random>
#include <system_error>
#include <utility>

#if defined(_WIN32)
#define WIN32_LEAN_AND_MEAN
#include <io.h>
#include <windows.h>
#else
#include <unistd.h>
#endif

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

// ---------------------------------------------------------------------------------------------
// ReplacingFile

namespace {

// Bytes that writes may still put out before they fail as on a full disk; negative: no limit.
std::atomic<long long> writeBudget{-1};

std::string Reason(int error) {
    return error != 0 ? std::generic_category().message(error) : "reason unknown";
}

// A name in the target's directory that no other writer picks: hidden, the target's name, a
// random part.
std::string TemporaryNameFor(const fs::path& target) {
    static std::atomic<unsigned long long> counter{0};
    static const unsigned long long seed = [] {
        std::random_device random;
        return (static_cast<unsigned long long>(random()) << 32) ^ random();
    }();
    const unsigned long long n = seed + 0x9E3779B97F4A7C15ull * ++counter;
    char suffix[24];
    std::snprintf(suffix, sizeof suffix, ".%012llx.tmp", n & 0xFFFFFFFFFFFFull);
    return (target.parent_path() / ("." + target.filename().string() + suffix)).string();
}

// Writes the file's buffered bytes through to the disk.
bool SyncToDisk(std::FILE* file) {
#if defined(_WIN32)
    return _commit(_fileno(file)) == 0;
#else
    return fsync(fileno(file)) == 0;
#endif
}

// Renames from over to, replacing to when it exists. Empty on success, otherwise the reason.
std::string RenameOver(const std::string& from, const std::string& to) {
#if defined(_WIN32)
    const std::wstring wideFrom = fs::path(from).wstring();
    const std::wstring wideTo = fs::path(to).wstring();
    if (MoveFileExW(wideFrom.c_str(), wideTo.c_str(),
                    MOVEFILE_REPLACE_EXISTING | MOVEFILE_WRITE_THROUGH) != 0) {
        return std::string();
    }
    return std::system_category().message(static_cast<int>(GetLastError()));
#else
    errno = 0;
    if (std::rename(from.c_str(), to.c_str()) == 0)
        return std::string();
    return Reason(errno);
#endif
}

}  // namespace

ReplacingFile::ReplacingFile(const std::string& target, const SourceLocation& where, bool textMode)
    : target_(target), destination_(target), where_(where) {
    std::error_code ec;
    fs::path destination(target);
    if (fs::is_symlink(destination, ec)) {
        fs::path resolved = fs::weakly_canonical(destination, ec);
        if (!ec)
            destination_ = resolved.string();
    }
    const fs::file_status status = fs::status(fs::path(destination_), ec);
    if (fs::exists(status) && !fs::is_regular_file(status) && !fs::is_directory(status)) {
        inPlace_ = true;
        path_ = target;
        errno = 0;
        file_ = std::fopen(path_.c_str(), textMode ? "w" : "wb");
        if (file_ == nullptr)
            Fail("cannot be created", Reason(errno));
        return;
    }
    int error = 0;
    for (int attempt = 0; attempt < 100 && file_ == nullptr; ++attempt) {
        path_ = TemporaryNameFor(fs::path(destination_));
        errno = 0;
        file_ = std::fopen(path_.c_str(), textMode ? "wx" : "wbx");
        error = errno;
        if (file_ == nullptr && error != EEXIST)
            break;
    }
    if (file_ == nullptr) {
        path_.clear();  // nothing of ours to remove
        Fail("cannot be created", Reason(error));
    }
    // The new file keeps the permissions of the one it replaces.
    if (fs::is_regular_file(status))
        fs::permissions(fs::path(path_), status.permissions(), ec);
}

ReplacingFile::~ReplacingFile() {
    Discard();
}

void ReplacingFile::Write(const char* bytes, std::size_t size) {
    if (file_ == nullptr)
        Fail("cannot be written", "the file is already closed");
    std::size_t allowed = size;
    bool full = false;
    long long budget = writeBudget.load();
    if (budget >= 0) {
        if (static_cast<unsigned long long>(budget) < size) {
            allowed = static_cast<std::size_t>(budget);
            full = true;
        }
        writeBudget = budget - static_cast<long long>(allowed);
    }
    errno = 0;
    if (allowed > 0 && std::fwrite(bytes, 1, allowed, file_) != allowed)
        Fail("cannot be written", Reason(errno));
    if (full)
        Fail("cannot be written", Reason(ENOSPC));
}

void ReplacingFile::Close() {
    if (closed_)
        return;
    errno = 0;
    bool ok = std::fflush(file_) == 0;
    int error = errno;
    if (ok && !inPlace_ && !SyncToDisk(file_)) {
        ok = false;
        error = errno;
    }
    std::FILE* file = std::exchange(file_, nullptr);
    closed_ = true;
    if (std::fclose(file) != 0 && ok) {
        ok = false;
        error = errno;
    }
    if (!ok)
        Fail("cannot be written", Reason(error));
}

void ReplacingFile::Commit() {
    Close();
    if (!inPlace_) {
        const std::string reason = RenameOver(path_, destination_);
        if (!reason.empty())
            Fail("cannot be replaced", reason);
    }
    committed_ = true;
}

void ReplacingFile::Fail(const char* what, const std::string& reason) {
    Discard();
    KESTREL_THROW_AT(where_, FileAccessException, target_, FileAccessException::CreateFailed,
                     FormatString("\"%s\" %s: %s", target_.c_str(), what, reason.c_str()));
}

void ReplacingFile::Discard() noexcept {
    if (file_ != nullptr) {
        std::fclose(file_);
        file_ = nullptr;
        closed_ = true;
    }
    if (!committed_ && !inPlace_ && !path_.empty()) {
        std::remove(path_.c_str());
        path_.clear();
    }
}

ScopedWriteLimit::ScopedWriteLimit(long long bytes) : previous_(writeBudget.exchange(bytes)) {}

ScopedWriteLimit::~ScopedWriteLimit() {
    writeBudget = previous_;
}

}  // namespace fileio
}  // namespace core
}  // namespace kestrel
