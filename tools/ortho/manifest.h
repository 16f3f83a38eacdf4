// What made an output: the identity of each input file and the value of each option that
// changes pixels, recorded beside the outputs (NAME_manifest.json, mosaic_manifest.json). A
// rerun compares the record with the current inputs and options, and makes again exactly the
// outputs whose record differs, saying why; file times alone would not do (copies and restores
// move them backwards).
#pragma once

#include "options.h"

#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace ortho {

// The options that change the pixels of the outputs, each with the way to read its value. A
// new option that changes pixels is one more line of the table in manifest.cpp. --proc is not
// one: the central-processor generator writes the same pixels on any number of threads, and a
// graphics processor asked for falls back to it.
struct PixelOption {
    const char* name;  // as the command line spells it
    // It moves the scenes' footprints too, so the common grid is worked out again.
    bool movesFootprints;
    std::string (*value)(const Options& options);
};
const std::vector<PixelOption>& PixelOptions();
// The options that change the mosaic alone (cutline, seamlines, blending, balance), recorded in
// mosaic_manifest.json only: a change makes the mosaic again and keeps the scenes.
const std::vector<PixelOption>& MosaicOptions();

// A file's identity: its size, its content hash, its last change. Files up to 1 MiB are hashed
// whole and compared by size and content; larger ones by their size, a hash of 16 blocks of
// 64 KiB spread evenly over them (the first and last included) and their modification time,
// since the sampled hash alone could miss a change between the blocks. Every slice of a run
// identifies every source, so no file costs more than 1 MiB of reading.
struct FileIdentity {
    std::uint64_t size = 0;
    std::string hash;      // 16 hex digits; "absent" when the file cannot be read
    std::string modified;  // UTC, ISO 8601
    bool sampled = false;

    // What a rerun compares.
    std::string Compared() const;
};
FileIdentity IdentifyFile(const std::string& path);

// The files of a dataset as GDAL lists them (with its side files: RPC, world and
// auxiliary files, ...); a directory: the files in it; otherwise the path alone.
std::vector<std::string> DatasetFiles(const std::string& path);

class Manifest {
  public:
    // An input or option; `note` is recorded but not compared (a file's modification time).
    // A change of a value that says nothing to people (a hash) is reported without it.
    void Set(const std::string& what, const std::string& value, const std::string& note = "",
             bool showValue = true);
    void SetFile(const std::string& role, const std::string& path, const FileIdentity& identity);

    // The note of an entry; empty when there is none.
    std::string Note(const std::string& what) const;

    std::string ToJson(const std::string& output) const;
    // False when the file is absent or not a manifest.
    bool Read(const std::string& path);

    // What differs from an earlier record, one phrase each ("--resample changed: bilinear ->
    // near"); empty when nothing does.
    std::vector<std::string> ChangesSince(const Manifest& earlier) const;
    // A short hash of what is compared, for the record of what depends on this one.
    std::string Fingerprint() const;

  private:
    struct Entry {
        std::string value;
        std::string note;
        bool shown = true;
    };
    std::vector<std::string> order_;
    std::map<std::string, Entry> entries_;
};

// The phrases of ChangesSince as one reason: the first few, and how many more.
std::string Reason(const std::vector<std::string>& changes);

// FNV-1a over the bytes, as 16 hex digits.
std::string Fingerprint(const std::string& text);

}  // namespace ortho
