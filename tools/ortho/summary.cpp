#include "summary.h"

#include "files.h"

#include <cmath>
#include <cstdio>
#include <sstream>

namespace ortho {

namespace {

// The length of the valid UTF-8 sequence at text[at], or 0 when the byte there does not start
// one (overlong forms, surrogates and values beyond U+10FFFF are not valid).
std::size_t Utf8Length(const std::string& text, std::size_t at) {
    const auto byte = [&](std::size_t i) {
        return at + i < text.size() ? static_cast<unsigned char>(text[at + i]) : 0u;
    };
    const unsigned int lead = byte(0);
    const auto continues = [&](std::size_t i, unsigned int low, unsigned int high) {
        return byte(i) >= low && byte(i) <= high;
    };
    if (lead < 0x80)
        return 1;
    if (lead >= 0xC2 && lead <= 0xDF)
        return continues(1, 0x80, 0xBF) ? 2 : 0;
    if (lead >= 0xE0 && lead <= 0xEF) {
        const unsigned int low = lead == 0xE0 ? 0xA0 : 0x80, high = lead == 0xED ? 0x9F : 0xBF;
        return continues(1, low, high) && continues(2, 0x80, 0xBF) ? 3 : 0;
    }
    if (lead >= 0xF0 && lead <= 0xF4) {
        const unsigned int low = lead == 0xF0 ? 0x90 : 0x80, high = lead == 0xF4 ? 0x8F : 0xBF;
        return continues(1, low, high) && continues(2, 0x80, 0xBF) && continues(3, 0x80, 0xBF)
                   ? 4
                   : 0;
    }
    return 0;
}

void AppendUtf8(std::string& out, unsigned int code) {
    if (code < 0x80) {
        out += static_cast<char>(code);
    } else if (code < 0x800) {
        out += static_cast<char>(0xC0 | (code >> 6));
        out += static_cast<char>(0x80 | (code & 0x3F));
    } else {
        out += static_cast<char>(0xE0 | (code >> 12));
        out += static_cast<char>(0x80 | ((code >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (code & 0x3F));
    }
}

std::string Number(double value, const char* format = "%.3f") {
    if (!std::isfinite(value))
        return "null";
    char text[32];
    std::snprintf(text, sizeof text, format, value);
    return text;
}

std::string PathOrNull(const std::string& path) {
    return path.empty() ? "null" : JsonString(path);
}

}  // namespace

std::string JsonString(const std::string& text) {
    std::string out = "\"";
    char escaped[8];
    for (std::size_t i = 0; i < text.size();) {
        const auto byte = static_cast<unsigned char>(text[i]);
        const std::size_t length = Utf8Length(text, i);
        if (length == 0) {
            std::snprintf(escaped, sizeof escaped, "\\udc%02x", byte);
            out += escaped;
            ++i;
            continue;
        }
        if (length > 1) {
            out.append(text, i, length);
            i += length;
            continue;
        }
        ++i;
        switch (byte) {
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
                if (byte < 0x20 || byte == 0x7F) {
                    std::snprintf(escaped, sizeof escaped, "\\u%04x", byte);
                    out += escaped;
                } else {
                    out += static_cast<char>(byte);
                }
        }
    }
    return out + "\"";
}

bool ReadJsonString(const std::string& text, std::size_t& at, std::string& value) {
    value.clear();
    for (std::size_t i = at; i < text.size(); ++i) {
        const char c = text[i];
        if (c == '"') {
            at = i + 1;
            return true;
        }
        if (c != '\\') {
            value += c;
            continue;
        }
        if (++i == text.size())
            return false;
        switch (text[i]) {
            case 'n':
                value += '\n';
                break;
            case 'r':
                value += '\r';
                break;
            case 't':
                value += '\t';
                break;
            case 'u': {
                unsigned int code = 0;
                for (int digit = 0; digit < 4; ++digit) {
                    const char h = ++i < text.size() ? text[i] : '\0';
                    const int v = h >= '0' && h <= '9'   ? h - '0'
                                  : h >= 'a' && h <= 'f' ? h - 'a' + 10
                                  : h >= 'A' && h <= 'F' ? h - 'A' + 10
                                                         : -1;
                    if (v < 0)
                        return false;
                    code = code * 16 + static_cast<unsigned int>(v);
                }
                // A lone low surrogate stands for the byte that was not UTF-8.
                if (code >= 0xDC80 && code <= 0xDCFF)
                    value += static_cast<char>(code - 0xDC00);
                else
                    AppendUtf8(value, code);
                break;
            }
            default:
                value += text[i];  // \" \\ \/
        }
    }
    return false;
}

std::string LegendJson(const std::vector<std::string>& scenes,
                       const std::vector<std::string>& colours) {
    std::ostringstream out;
    out << "[";
    for (std::size_t k = 0; k < colours.size() && k <= scenes.size(); ++k)
        out << (k ? ", " : "") << "{\"value\": " << k
            << ", \"scene\": " << (k == 0 ? "null" : JsonString(scenes[k - 1]))
            << ", \"colour\": " << JsonString(colours[k]) << "}";
    out << "]";
    return out.str();
}

std::string BalanceJson(const MosaicBalance& balance) {
    std::ostringstream out;
    const auto list = [&](const std::vector<std::vector<double>>& values, std::size_t scene) {
        out << "[";
        if (scene < values.size()) {
            for (std::size_t c = 0; c < values[scene].size(); ++c)
                out << (c ? ", " : "") << Number(values[scene][c], "%.6g");
        }
        out << "]";
    };
    out << "{\"method\": " << JsonString(balance.method) << ", \"blend\": "
        << JsonString(balance.blend) << ", \"blend_width\": " << balance.blendWidth
        << ", \"seams\": " << JsonString(balance.seams) << ", \"seamlines\": " << PathOrNull(balance.seamlines) << ", \"scenes\": [";
    for (std::size_t i = 0; i < balance.scenes.size(); ++i) {
        out << (i ? ", " : "") << "{\"scene\": " << JsonString(balance.scenes[i])
            << ", \"gain\": ";
        list(balance.gain, i);
        out << ", \"offset\": ";
        list(balance.offset, i);
        out << "}";
    }
    out << "]}";
    return out.str();
}

std::string ToJson(const RunSummary& summary) {
    std::ostringstream out;
    out << "{\n  \"master\": " << JsonString(summary.master)
        << ",\n  \"status\": " << JsonString(summary.status) << ",\n  \"scenes\": [";
    for (std::size_t i = 0; i < summary.scenes.size(); ++i) {
        const SceneSummary& s = summary.scenes[i];
        out << (i ? ",\n" : "\n") << "    {\"line\": " << s.line
            << ", \"master_line\": " << s.masterLine
            << ", \"source\": " << JsonString(s.source) << ", \"ortho\": " << PathOrNull(s.ortho)
            << ", \"visibility\": " << PathOrNull(s.visibility)
            << ", \"scene\": " << PathOrNull(s.scene)
            << ", \"footprint\": " << PathOrNull(s.footprint) << ", \"status\": " << JsonString(s.status)
            << ", \"seconds\": " << Number(s.seconds);
        if (!s.error.empty())
            out << ", \"error\": " << JsonString(s.error);
        if (!s.reason.empty())
            out << ", \"reason\": " << JsonString(s.reason);
        out << "}";
    }
    out << (summary.scenes.empty() ? "],\n" : "\n  ],\n");
    out << "  \"mosaic\": " << PathOrNull(summary.mosaic) << ",\n";
    out << "  \"mosaic_source\": " << PathOrNull(summary.mosaicSource) << ",\n";
    out << "  \"mosaic_reason\": " << PathOrNull(summary.mosaicReason) << ",\n";
    out << "  \"mosaic_scenes\": [";
    for (std::size_t i = 0; i < summary.mosaicScenes.size(); ++i)
        out << (i ? ", " : "") << JsonString(summary.mosaicScenes[i]);
    out << "],\n";
    out << "  \"mosaic_legend\": " << LegendJson(summary.mosaicScenes, summary.mosaicColours)
        << ",\n";
    out << "  \"seamlines\": " << PathOrNull(summary.seamlines) << ",\n";
    out << "  \"balance\": " << (summary.balance.empty() ? "null" : summary.balance) << ",\n";
    out << "  \"footprints\": " << PathOrNull(summary.footprints) << ",\n";
    out << "  \"quicklooks\": [";
    for (std::size_t i = 0; i < summary.quicklooks.size(); ++i)
        out << (i ? ", " : "") << JsonString(summary.quicklooks[i]);
    out << "],\n  \"errors\": [";
    for (std::size_t i = 0; i < summary.errors.size(); ++i)
        out << (i ? ", " : "") << JsonString(summary.errors[i]);
    out << "],\n  \"timings\": {";
    for (std::size_t i = 0; i < summary.timings.size(); ++i)
        out << (i ? ", " : "") << JsonString(summary.timings[i].first) << ": "
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
