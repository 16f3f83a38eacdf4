// File-name utility of the suite's core library.
#pragma once

#include <string>

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

}  // namespace fileio
}  // namespace core
}  // namespace kestrel

// True when name names an existing file or directory.
KESTREL_API bool IsFile(const std::string& name);
