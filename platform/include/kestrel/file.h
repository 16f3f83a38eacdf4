// File-name utility of the suite's core library.
#pragma once

#include <cstddef>
#include <cstdio>
#include <string>

#include <kestrel/exception.h>
#include <kestrel/export.h>

namespace kestrel {
namespace core {
namespace fileio {

// A file name and what can be told of it. Names are narrow byte strings, as the processes pass
// them; both "/" and "\" separate directories in base names, since parameter files are also
// written on Windows.
class KESTREL_API File {
  public:
    explicit File(const std::string& name);
    explicit File(const char* name);

    // The name as given.
    const std::string& GetName() const { return name_; }

    // The name without its directory part; the extension stays ("d:\img\a.tif" gives "a.tif").
    // A name that ends in a separator has an empty base name.
    std::string GetBasename() const;

    // The name with "." and ".." segments resolved lexically and the platform's separator.
    std::string GetNormalizedName() const;

    // The absolute directory of the file, ending in a separator, so that a file name can be
    // appended to it directly. A relative name is taken from the current directory.
    std::string GetAbsolutePath() const;

    // Whether something exists under this name.
    bool Exists() const;

  private:
    std::string name_;
};

// Writes a file whole or not at all. The bytes go to a new temporary file in the target's
// directory; Commit flushes it to the disk, closes it and renames it over the target, so that the
// target is at every moment either the previous file or the complete new one. Whatever is not
// committed (an error, an exception unwinding through the writer) is removed, and the target is
// left byte for byte as it was. A symbolic link is followed to the file it names; a target that
// exists and is no regular file (a device, a pipe) is written in place, since a rename would
// replace the device node itself. Failures throw FileAccessException (CreateFailed) naming the
// target, reported at `where`.
class KESTREL_API ReplacingFile {
  public:
    // textMode: line ends as the platform's text mode writes them (CR LF on Windows).
    ReplacingFile(const std::string& target, const SourceLocation& where, bool textMode = false);
    ~ReplacingFile();
    ReplacingFile(const ReplacingFile&) = delete;
    ReplacingFile& operator=(const ReplacingFile&) = delete;

    void Write(const char* bytes, std::size_t size);
    void Write(const std::string& text) { Write(text.data(), text.size()); }

    // Flushes the bytes to the disk and closes the temporary file; the target is not touched yet.
    void Close();
    // Closes the file if that has not been done, then puts it in place of the target.
    void Commit();

    const std::string& GetTarget() const { return target_; }

  private:
    [[noreturn]] void Fail(const char* what, const std::string& reason);
    void Discard() noexcept;

    std::string target_;
    std::string destination_;  // the target with a symbolic link followed
    std::string path_;         // the temporary file, or the target when written in place
    SourceLocation where_;
    std::FILE* file_ = nullptr;
    bool inPlace_ = false;
    bool closed_ = false;
    bool committed_ = false;
};

// For tests: lets the writes of every ReplacingFile succeed for `bytes` more bytes and then fail
// as on a full disk (ENOSPC), for the lifetime of the object. Not meant to be used while another
// thread writes a file.
class KESTREL_API ScopedWriteLimit {
  public:
    explicit ScopedWriteLimit(long long bytes);
    ~ScopedWriteLimit();
    ScopedWriteLimit(const ScopedWriteLimit&) = delete;
    ScopedWriteLimit& operator=(const ScopedWriteLimit&) = delete;

  private:
    long long previous_;
};

}  // namespace fileio
}  // namespace core
}  // namespace kestrel

// True when name names an existing file or directory.
KESTREL_API bool IsFile(const std::string& name);
