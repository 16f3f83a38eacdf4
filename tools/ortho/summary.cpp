#include "summary.h"

#include "files.h"

#include <cmath>
#include <cstdio>
#include <sstream>

namespace ortho {

namespace {

std::string Json(const std::string& text) {
    std::string out = "\"";
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        switch (c) {
            case '"':
                out += "\\\"";
                break;
            case '\\':
                out += "\\\\";
                break;
            case '\n':
                out += "\\n";
                break;
            case '\r':
                out += "\\r";
                break;
            case '\t':
                out += "\\t";
                break;
            default:
                if (byte < 0x20) {
                    char escaped[8];
                    std::snprintf(escaped, sizeof escaped, "\\u%04x", byte);
                    out += escaped;
                } else {
                    out += c;
                }
        }
    }
    return out + "\"";
}

std::string Number(double value) {
    if (!std::isfinite(value))
        return "null";
    char text[32];
    std::snprintf(text, sizeof text, "%.3f", value);
    return text;
}

std::string PathOrNull(const std::string& path) {
    return path.empty() ? "null" : Json(path);
}

}  // namespace

std::string ToJson(const RunSummary& summary) {
    std::ostringstream out;
    out << "{\n  \"master\": " << Json(summary.master)
        << ",\n  \"status\": " << Json(summary.status) << ",\n  \"scenes\": [";
    for (std::size_t i = 0; i < summary.scenes.size(); ++i) {
        const SceneSummary& s = summary.scenes[i];
        out << (i ? ",\n" : "\n") << "    {\"line\": " << s.line
            << ", \"source\": " << Json(s.source) << ", \"ortho\": " << PathOrNull(s.ortho)
            << ", \"visibility\": " << PathOrNull(s.visibility)
            << ", \"scene\": " << PathOrNull(s.scene)
            << ", \"footprint\": " << PathOrNull(s.footprint) << ", \"status\": " << Json(s.status)
            << ", \"seconds\": " << Number(s.seconds);
        if (!s.error.empty())
            out << ", \"error\": " << Json(s.error);
        out << "}";
    }
    out << (summary.scenes.empty() ? "],\n" : "\n  ],\n");
    out << "  \"mosaic\": " << PathOrNull(summary.mosaic) << ",\n";
    out << "  \"mosaic_source\": " << PathOrNull(summary.mosaicSource) << ",\n";
    out << "  \"mosaic_scenes\": [";
    for (std::size_t i = 0; i < summary.mosaicScenes.size(); ++i)
        out << (i ? ", " : "") << Json(summary.mosaicScenes[i]);
    out << "],\n";
    out << "  \"footprints\": " << PathOrNull(summary.footprints) << ",\n";
    out << "  \"quicklooks\": [";
    for (std::size_t i = 0; i < summary.quicklooks.size(); ++i)
        out << (i ? ", " : "") << Json(summary.quicklooks[i]);
    out << "],\n  \"errors\": [";
    for (std::size_t i = 0; i < summary.errors.size(); ++i)
        out << (i ? ", " : "") << Json(summary.errors[i]);
    out << "],\n  \"timings\": {";
    for (std::size_t i = 0; i < summary.timings.size(); ++i)
        out << (i ? ", " : "") << Json(summary.timings[i].first) << ": "
            << Number(summary.timings[i].second);
    out << "}\n}\n";
    return out.str();
}

void WriteFileAtomically(const std::string& path, const std::string& text) {
    const std::string part = UniquePartName(path);
    {
        std::FILE* file = std::fopen(part.c_str(), "wb");
        if (file == nullptr)
            KESTREL_THROW(kestrel::FileAccessException, path, kestrel::FileAccessException::Type(5),
                          "cannot be created");
        const bool written = std::fwrite(text.data(), 1, text.size(), file) == text.size();
        const bool closed = std::fclose(file) == 0;
        if (!written || !closed) {
            std::remove(part.c_str());
            KESTREL_THROW(kestrel::FileAccessException, path, kestrel::FileAccessException::Type(5),
                          "cannot be written");
        }
    }
    Publish(part, path);
}

}  // namespace ortho
