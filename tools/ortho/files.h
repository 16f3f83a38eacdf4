// Output files of the workflow: temporary names, publishing, ages, and error texts.
#pragma once

#include <kestrel/exception.h>

#include <exception>
#include <string>

namespace ortho {

// The temporary name an output is written under until it is whole: "dir/a_ortho.tif" gives
// "dir/a_ortho.part.tif" (the extension stays, for the drivers that look at it).
std::string PartName(const std::string& path);

// A temporary name of this process's own, for outputs that several processes (the slices of
// one run) may write at the same time.
std::string UniquePartName(const std::string& path);

// Renames a finished part over its final name, with the side files of a raster or vector
// dataset (kestrel::datasources::PublishDataset). Throws FileAccessException naming both.
void Publish(const std::string& part, const std::string& path);

bool FileExists(const std::string& path);
void RemoveFile(const std::string& path);  // no error when absent

// Seconds of the last change on the file system's clock (whose epoch may lie in the future:
// compare, do not read); minus infinity when the file is absent.
double ModifiedTime(const std::string& path);

// One line saying what went wrong, with the file name of file errors.
std::string Explain(const std::exception& error);

}  // namespace ortho
