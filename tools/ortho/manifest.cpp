#include "manifest.h"

#include "steps.h"
#include "summary.h"

#include <cpl_error.h>
#include <gdal_priv.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace fs = std::filesystem;

namespace ortho {

namespace {

std::string Number(double value) {
    char text[32];
    std::snprintf(text, sizeof text, "%.17g", value);
    return text;
}

// The same file however the command line names it.
std::string AbsolutePath(const std::string& path) {
    std::error_code ec;
    return fs::absolute(path, ec).lexically_normal().string();
}

// A file option's value: the file however the command line names it; empty when not given.
std::string FilePath(const std::string& file) {
    return file.empty() ? std::string() : AbsolutePath(file);
}

std::string Joined(const std::vector<float>& values) {
    std::string text;
    for (const float v : values)
        text += (text.empty() ? "" : ",") + Number(v);
    return text;
}

constexpr std::uint64_t kFnvOffset = 1469598103934665603ULL;
constexpr std::uint64_t kFnvPrime = 1099511628211ULL;

std::string Hex(std::uint64_t hash) {
    char hex[17];
    std::snprintf(hex, sizeof hex, "%016llx", static_cast<unsigned long long>(hash));
    return hex;
}

// FNV-1a taken eight bytes at a time, for speed on large files.
void HashWords(std::uint64_t& hash, const char* data, std::size_t size) {
    std::size_t i = 0;
    for (; i + 8 <= size; i += 8) {
        std::uint64_t word;
        std::memcpy(&word, data + i, 8);
        hash = (hash ^ word) * kFnvPrime;
    }
    for (; i < size; ++i)
        hash = (hash ^ static_cast<unsigned char>(data[i])) * kFnvPrime;
}

std::string UtcTime(const fs::file_time_type& time) {
    // The file clock's epoch is not the system clock's before C++20: shift through "now".
    const auto system = std::chrono::time_point_cast<std::chrono::system_clock::duration>(
        time - fs::file_time_type::clock::now() + std::chrono::system_clock::now());
    const std::time_t seconds = std::chrono::system_clock::to_time_t(system);
    std::tm utc{};
#ifdef _WIN32
    gmtime_s(&utc, &seconds);
#else
    gmtime_r(&seconds, &utc);
#endif
    char text[32];
    std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", &utc);
    return text;
}

constexpr std::uint64_t kWholeFileLimit = 1u << 20;
constexpr std::uint64_t kSampleBlock = 64u << 10;
constexpr std::uint64_t kSampleBlocks = 16;

// The --co options the orthos (or the mosaic) are made with: an option only the other's driver
// takes changes nothing here.
std::string CreationOptions(const Options& o, bool mosaic) {
    std::string text;
    for (const std::string& option : TakenCreationOptions(o, mosaic))
        text += (text.empty() ? "" : " ") + option;
    return text;
}

// A recorded value as a reason shows it: "(none)" for an option not given.
std::string Shown(const std::string& value) {
    return value.empty() ? "(none)" : value;
}

}  // namespace

const std::vector<PixelOption>& PixelOptions() {
    static const std::vector<PixelOption> options = {
        {"surface model", true,
         [](const Options& o) {
             return (o.dem.empty() ? "--tin " : "--dem ") + AbsolutePath(o.dem + o.tin);
         }},
        {"--elevref", true, [](const Options& o) { return o.elevref; }},
        {"--elfactor", true, [](const Options& o) { return Joined(o.elfactor); }},
        {"--elunits", true, [](const Options& o) { return o.elunits; }},
        {"--srs", true, [](const Options& o) { return o.srs; }},
        {"--pixel-size", true, [](const Options& o) { return Number(o.pixelSize); }},
        {"--tr", true,
         [](const Options& o) {
             return o.xRes > 0.0 ? Number(o.xRes) + " " + Number(o.yRes) : std::string();
         }},
        {"--te", true,
         [](const Options& o) {
             if (!o.hasExtent)
                 return std::string();
             std::string text;
             for (const double v : o.extent)
                 text += (text.empty() ? "" : " ") + Number(v);
             return o.extentSrs.empty() ? text : text + " --te-srs " + o.extentSrs;
         }},
        {"--cameras", true,
         [](const Options& o) {
             return o.camerasSrs.empty() ? o.cameras : o.cameras + " --cameras-srs " + o.camerasSrs;
         }},
        {"--resample", false, [](const Options& o) { return o.resample; }},
        {"--of", false, [](const Options& o) { return o.format; }},
        {"--co", false, [](const Options& o) { return CreationOptions(o, false); }},
    };
    return options;
}

const std::vector<PixelOption>& MosaicOptions() {
    static const std::vector<PixelOption> options = {
        {"--cutline", false, [](const Options& o) { return FilePath(o.cutline); }},
        {"--seamlines", false, [](const Options& o) { return FilePath(o.seamlines); }},
        {"--seams", false, [](const Options& o) { return o.seams; }},
        {"--dtm", false, [](const Options& o) { return FilePath(o.dtm); }},
        {"--blend-width", false,
         [](const Options& o) {
             return std::to_string(BlendWidth(o));
         }},
        {"--blend", false, [](const Options& o) { return o.blend; }},
        {"--balance", false, [](const Options& o) { return o.balance; }},
        {"--co", false, [](const Options& o) { return CreationOptions(o, true); }},
    };
    return options;
}

std::string FileIdentity::Compared() const {
    return std::to_string(size) + " bytes, hash " + hash +
           (sampled ? " of samples, modified " + modified : std::string());
}

FileIdentity IdentifyFile(const std::string& path) {
    FileIdentity identity;
    identity.hash = "absent";
    std::error_code ec;
    const auto size = fs::file_size(path, ec);
    if (ec)
        return identity;
    const auto modified = fs::last_write_time(path, ec);
    if (!ec)
        identity.modified = UtcTime(modified);
    std::ifstream in(path, std::ios::binary);
    if (!in)
        return identity;
    identity.size = size;
    identity.sampled = size > kWholeFileLimit;
    std::uint64_t hash = kFnvOffset;
    std::vector<char> buffer(1u << 20);
    if (!identity.sampled) {
        while (in) {
            in.read(buffer.data(), static_cast<std::streamsize>(buffer.size()));
            HashWords(hash, buffer.data(), static_cast<std::size_t>(in.gcount()));
        }
    } else {
        const std::uint64_t last = size - kSampleBlock;
        for (std::uint64_t block = 0; block < kSampleBlocks; ++block) {
            in.seekg(static_cast<std::streamoff>(last / (kSampleBlocks - 1) * block));
            in.read(buffer.data(), static_cast<std::streamsize>(kSampleBlock));
            HashWords(hash, buffer.data(), static_cast<std::size_t>(in.gcount()));
        }
    }
    identity.hash = in.bad() ? "unreadable" : Hex(hash);
    return identity;
}

std::vector<std::string> DatasetFiles(const std::string& path) {
    std::vector<std::string> files;
    std::error_code ec;
    if (fs::is_directory(path, ec)) {
        for (const auto& entry : fs::directory_iterator(path, ec)) {
            if (entry.is_regular_file(ec))
                files.push_back(AbsolutePath(entry.path().string()));
        }
        std::sort(files.begin(), files.end());
        return files;
    }
    {
        kestrel::gdalsupport::EnsureRegistered();
        kestrel::gdalsupport::ErrorCapture quiet;
        GDALDatasetH dataset =
            GDALOpenEx(path.c_str(), GDAL_OF_RASTER | GDAL_OF_VECTOR | GDAL_OF_READONLY, nullptr,
                       nullptr, nullptr);
        if (dataset != nullptr) {
            char** list = GDALGetFileList(dataset);
            for (char** name = list; name != nullptr && *name != nullptr; ++name)
                files.push_back(AbsolutePath(*name));
            CSLDestroy(list);
            GDALClose(dataset);
        }
    }
    const std::string self = AbsolutePath(path);
    if (std::find(files.begin(), files.end(), self) == files.end())
        files.insert(files.begin(), self);
    return files;
}

void Manifest::Set(const std::string& what, const std::string& value, const std::string& note,
                   bool showValue) {
    if (entries_.find(what) == entries_.end())
        order_.push_back(what);
    entries_[what] = {value, note, showValue};
}

void Manifest::SetFile(const std::string& role, const std::string& path,
                       const FileIdentity& identity) {
    Set(role + " " + path, identity.Compared(),
        identity.sampled || identity.modified.empty() ? "" : "modified " + identity.modified);
}

std::string Manifest::Note(const std::string& what) const {
    const auto entry = entries_.find(what);
    return entry == entries_.end() ? std::string() : entry->second.note;
}

std::string Manifest::ToJson(const std::string& output) const {
    std::string text = "{\n  \"output\": " + JsonString(output) + ",\n  \"made from\": [";
    for (std::size_t i = 0; i < order_.size(); ++i) {
        const Entry& entry = entries_.at(order_[i]);
        text += std::string(i ? ",\n" : "\n") + "    {\"what\": " + JsonString(order_[i]) +
                ", \"value\": " + JsonString(entry.value) + ", \"note\": " +
                JsonString(entry.note) + "}";
    }
    return text + "\n  ]\n}\n";
}

bool Manifest::Read(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    if (!in)
        return false;
    std::string line;
    bool header = false;
    order_.clear();
    entries_.clear();
    // One entry a line, as ToJson writes them: the strings of "what", "value" and "note".
    while (std::getline(in, line)) {
        if (line.find("\"made from\": [") != std::string::npos)
            header = true;
        if (!header || line.find("{\"what\": ") == std::string::npos)
            continue;
        std::vector<std::string> strings;
        for (std::size_t at = line.find('"'); at != std::string::npos; at = line.find('"', at)) {
            std::string value;
            ++at;
            if (!ReadJsonString(line, at, value))
                return false;
            strings.push_back(value);
        }
        if (strings.size() != 6 || strings[0] != "what" || strings[2] != "value" ||
            strings[4] != "note")
            return false;
        Set(strings[1], strings[3], strings[5]);
    }
    return header;
}

std::vector<std::string> Manifest::ChangesSince(const Manifest& earlier) const {
    std::vector<std::string> changes;
    for (const std::string& what : order_) {
        const auto before = earlier.entries_.find(what);
        const Entry& now = entries_.at(what);
        if (before == earlier.entries_.end())
            changes.push_back(what + " is new");
        else if (before->second.value != now.value)
            changes.push_back(what + " changed" +
                              (now.shown ? ": " + Shown(before->second.value) + " -> " +
                                               Shown(now.value)
                                         : ""));
    }
    for (const std::string& what : earlier.order_) {
        if (entries_.find(what) == entries_.end())
            changes.push_back(what + " is no longer used");
    }
    return changes;
}

std::string Manifest::Fingerprint() const {
    std::string text;
    for (const std::string& what : order_)
        text += what + '\n' + entries_.at(what).value + '\n';
    return ortho::Fingerprint(text);
}

std::string Reason(const std::vector<std::string>& changes) {
    constexpr std::size_t kShown = 3;
    std::string text;
    for (std::size_t i = 0; i < changes.size() && i < kShown; ++i)
        text += (i ? "; " : "") + changes[i];
    if (changes.size() > kShown)
        text += "; and " + std::to_string(changes.size() - kShown) + " more";
    return text;
}

std::string Fingerprint(const std::string& text) {
    std::uint64_t hash = kFnvOffset;
    for (const char c : text)
        hash = (hash ^ static_cast<unsigned char>(c)) * kFnvPrime;
    return Hex(hash);
}

}  // namespace ortho
