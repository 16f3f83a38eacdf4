#include "files.h"

#include "../message.h"

#include <kestrel/rasterio.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <system_error>

#ifdef _WIN32
#ifndef NOMINMAX
#define NOMINMAX
#endif
#include <process.h>
#include <windows.h>
#else
#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#endif

namespace fs = std::filesystem;

namespace ortho {

std::string PartName(const std::string& path) {
    const fs::path p(path);
    const std::string extension = p.extension().string();
    if (extension == ".xml" || extension == ".json" || extension == ".txt" || extension.empty())
        return path + ".part";
    return (p.parent_path() / (p.stem().string() + ".part" + extension)).string();
}

long long ProcessId() {
#ifdef _WIN32
    return _getpid();
#else
    return getpid();
#endif
}

std::string UniquePartName(const std::string& path) {
    return PartName(path) + "." + std::to_string(ProcessId());
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

std::string Explain(const std::exception& error) {
    return tools::UserMessage(error);
}

// The holder's description is at the start of the file; the lock covers one byte far beyond
// it, because Windows' locks keep other processes from reading what they cover.
struct RunLock::Handle {
#ifdef _WIN32
    HANDLE file = INVALID_HANDLE_VALUE;
    ~Handle() {
        if (file != INVALID_HANDLE_VALUE)
            CloseHandle(file);  // releases the lock
    }
#else
    int fd = -1;
    ~Handle() {
        if (fd >= 0)
            close(fd);  // releases the lock
    }
#endif
};

RunLock::RunLock(const std::string& directory, bool shared, const std::string& who)
    : handle_(std::make_unique<Handle>()) {
    const fs::path path = fs::path(directory) / FileName();
    std::string holder;
    bool locked = false;
    const std::string text = who + "\n";
#ifdef _WIN32
    handle_->file = CreateFileW(path.wstring().c_str(), GENERIC_READ | GENERIC_WRITE,
                                FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE, nullptr,
                                OPEN_ALWAYS, FILE_ATTRIBUTE_NORMAL, nullptr);
    if (handle_->file == INVALID_HANDLE_VALUE)
        throw std::runtime_error(path.string() + ": cannot be opened as the run's lock");
    OVERLAPPED where = {};
    where.Offset = 0;
    where.OffsetHigh = 1;  // at 4 GiB, far from the text
    locked = LockFileEx(handle_->file,
                        LOCKFILE_FAIL_IMMEDIATELY | (shared ? 0 : LOCKFILE_EXCLUSIVE_LOCK), 0, 1,
                        0, &where) != 0;
    if (locked) {
        DWORD written = 0;
        SetFilePointer(handle_->file, 0, nullptr, FILE_BEGIN);
        SetEndOfFile(handle_->file);
        WriteFile(handle_->file, text.data(), static_cast<DWORD>(text.size()), &written, nullptr);
    } else {
        char buffer[256] = {};
        DWORD read = 0;
        SetFilePointer(handle_->file, 0, nullptr, FILE_BEGIN);
        ReadFile(handle_->file, buffer, sizeof buffer - 1, &read, nullptr);
        holder.assign(buffer, read);
    }
#else
    handle_->fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    if (handle_->fd < 0)
        throw std::runtime_error(path.string() +
                                 ": cannot be opened as the run's lock: " + std::strerror(errno));
    locked = flock(handle_->fd, (shared ? LOCK_SH : LOCK_EX) | LOCK_NB) == 0;
    if (locked) {
        if (ftruncate(handle_->fd, 0) != 0 ||
            pwrite(handle_->fd, text.data(), text.size(), 0) < 0) {
            // The lock holds without the description; a refused run says less.
        }
    } else {
        char buffer[256] = {};
        const ssize_t read = pread(handle_->fd, buffer, sizeof buffer - 1, 0);
        if (read > 0)
            holder.assign(buffer, static_cast<std::size_t>(read));
    }
#endif
    if (locked)
        return;
    while (!holder.empty() && (holder.back() == '\n' || holder.back() == '\r'))
        holder.pop_back();
    throw std::runtime_error(directory + " is in use by another silvan-ortho run" +
                             (holder.empty() ? std::string() : ": " + holder) +
                             "; wait for it to end, or stop it, then run again");
}

RunLock::~RunLock() = default;

std::string ReadText(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

std::vector<std::pair<unsigned int, std::string>> DataLines(const std::string& path) {
    std::vector<std::pair<unsigned int, std::string>> lines;
    std::string text = ReadText(path);
    if (text.compare(0, 3, "\xEF\xBB\xBF") == 0)
        text.erase(0, 3);
    unsigned int number = 0;
    for (std::size_t start = 0; start < text.size();) {
        std::size_t end = text.find_first_of("\r\n", start);
        if (end == std::string::npos)
            end = text.size();
        const std::string line = text.substr(start, end - start);
        ++number;
        if (!line.empty() && line[0] != '!' &&
            line.find_first_not_of(" \t") != std::string::npos)
            lines.emplace_back(number, line);
        start = end + (text.compare(end, 2, "\r\n") == 0 ? 2 : 1);
    }
    return lines;
}

std::vector<std::string> LineColumns(const std::string& line) {
    std::vector<std::string> columns;
    std::istringstream fields(line);
    for (std::string field; std::getline(fields, field, ';');) {
        field.erase(0, field.find_first_not_of(" \t"));
        field.erase(field.find_last_not_of(" \t") + 1);
        columns.push_back(std::move(field));
    }
    if (columns.empty())
        columns.emplace_back();
    return columns;
}

std::string ResolveSource(const std::string& given, const fs::path& masterDir) {
    std::error_code ec;
    fs::path source(given);
    if (source.is_relative() && (fs::exists(masterDir / source, ec) || !fs::exists(source, ec)))
        source = masterDir / source;
    return fs::absolute(source, ec).lexically_normal().string();
}

}  // namespace ortho
