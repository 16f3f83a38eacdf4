#include <kestrel/disk.h>

#include <cerrno>
#include <filesystem>
#include <string>
#include <system_error>

#include <kestrel/exception.h>

namespace {

std::string SystemReason(int error) {
    return std::error_code(error, std::generic_category()).message();
}

}  // namespace

std::FILE* DKOpen(const char* name, int /*access*/, const char* mode) {
    if (name == nullptr || *name == '\0') {
        KESTREL_THROW(kestrel::FileAccessException, "", kestrel::FileAccessException::OpenFailed,
                      "Cannot open a file without a name");
    }
    if (mode == nullptr || *mode == '\0') {
        KESTREL_THROW(kestrel::FileAccessException, name, kestrel::FileAccessException::OpenFailed,
                      kestrel::FormatString("Cannot open file %s: no open mode given", name));
    }
    errno = 0;
    std::FILE* file = std::fopen(name, mode);
    if (file == nullptr) {
        const int error = errno;
        KESTREL_THROW(
            kestrel::FileAccessException, name, kestrel::FileAccessException::OpenFailed,
            kestrel::FormatString("Cannot open file %s with mode \"%s\": %s", name, mode,
                                  error != 0 ? SystemReason(error).c_str() : "reason unknown"));
    }
    return file;
}

void DKClose(std::FILE* file) {
    if (file == nullptr)
        return;
    const bool failedBefore = std::ferror(file) != 0;
    errno = 0;
    const int closed = std::fclose(file);
    const int error = errno;
    if (failedBefore || closed != 0) {
        KESTREL_THROW(kestrel::FileAccessException, "", kestrel::FileAccessException::WriteFailed,
                      kestrel::FormatString("Writing a file failed: %s",
                                            error != 0 ? SystemReason(error).c_str()
                                                       : "an earlier write or read failed"));
    }
}

int DKCheck(const char* name) {
    if (name == nullptr || *name == '\0')
        return 0;
    std::error_code ec;
    return std::filesystem::exists(std::filesystem::path(name), ec) ? 1 : 0;
}
