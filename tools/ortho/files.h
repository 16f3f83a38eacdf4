// Output files of the workflow: temporary names, publishing, the run's lock, and error texts.
#pragma once

#include <kestrel/exception.h>

#include <exception>
#include <filesystem>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace ortho {

// The temporary name an output is written under until it is whole. Rasters and GeoPackages
// keep their extension, for the drivers that look at it: "dir/a_ortho.tif" gives
// "dir/a_ortho.part.tif"; every other file gets ".part" appended: "dir/a.xml" gives
// "dir/a.xml.part". So no temporary name is ever another output's final name: a final name
// ending in ".xml" or ".json" never ends in ".part", and the final names of rasters and
// GeoPackages end in a word ("_ortho", "_vis", "mosaic", ...) that is never "part".
std::string PartName(const std::string& path);

// A temporary name of this process's own, for outputs that several processes (the slices of
// one run) may write at the same time.
std::string UniquePartName(const std::string& path);

// Renames a finished part over its final name, with the side files of a raster or vector
// dataset (kestrel::datasources::PublishDataset). Throws FileAccessException naming both.
void Publish(const std::string& part, const std::string& path);

bool FileExists(const std::string& path);
void RemoveFile(const std::string& path);  // no error when absent

// One line saying what went wrong, with the file name of file errors.
std::string Explain(const std::exception& error);

// The lock of an output directory, held for the whole run through an operating-system lock
// (flock, LockFileEx) on the file DIR/.silvan-ortho.lock: the system drops it when the process
// ends, however it ends, so a crashed run leaves nothing stuck. A whole run holds it alone;
// slices (--lines) share it with each other, as a cluster runs them side by side. The holder
// writes who it is into the file, for the message of a run that is refused.
class RunLock {
  public:
    // Takes the lock or throws std::runtime_error naming the process that holds it. `who`
    // describes this run for others ("process 123 (--lines 0:20)").
    RunLock(const std::string& directory, bool shared, const std::string& who);
    ~RunLock();
    RunLock(const RunLock&) = delete;
    RunLock& operator=(const RunLock&) = delete;

    static std::string FileName() { return ".silvan-ortho.lock"; }

  private:
    struct Handle;
    std::unique_ptr<Handle> handle_;
};

// A file's bytes; empty when it cannot be read.
std::string ReadText(const std::string& path);

// The data lines of a parameter file with their numbers (from 1): every line but header and
// comment lines ("!" first) and blank ones, with lines ended by LF, CR LF or CR alone, as the
// parameter-table reader counts them.
std::vector<std::pair<unsigned int, std::string>> DataLines(const std::string& path);

// The columns of a data line: separated by ";", blanks (spaces and tabs) trimmed, as the
// parameter table reads them.
std::vector<std::string> LineColumns(const std::string& line);

// A source as a line names it: relative to the master file's directory when it exists there
// (or nowhere else), absolute and normalised.
std::string ResolveSource(const std::string& given, const std::filesystem::path& masterDir);

// This process's identifier.
long long ProcessId();

}  // namespace ortho
