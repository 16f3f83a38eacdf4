#include <kestrel/mfileparser.h>

#include <kestrel/exception.h>

#include <algorithm>
#include <charconv>
#include <climits>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <memory>
#include <system_error>

namespace kestrel {

namespace {

bool IsBlank(char c) { return c == ' ' || c == '\t'; }

// A piece of the file's text.
struct Span {
    const char* begin;
    const char* end;
    bool Empty() const { return begin == end; }
    std::size_t Size() const { return static_cast<std::size_t>(end - begin); }
};

Span Trim(Span s) {
    while (s.begin != s.end && IsBlank(*s.begin)) ++s.begin;
    while (s.end != s.begin && IsBlank(s.end[-1])) --s.end;
    return s;
}

// Reads the whole file into text. False when it cannot be opened or read.
bool ReadWholeFile(const std::string& filename, std::string& text) {
    std::error_code ec;
    const std::filesystem::path path = std::filesystem::path(filename);
    if (!std::filesystem::is_regular_file(path, ec)) return false;
    const auto expected = std::filesystem::file_size(path, ec);
    if (ec) return false;

    std::unique_ptr<std::FILE, int (*)(std::FILE*)> file(std::fopen(filename.c_str(), "rb"),
                                                        &std::fclose);
    if (!file) return false;
    text.resize(static_cast<std::size_t>(expected));
    std::size_t got = std::fread(&text[0], 1, text.size(), file.get());
    if (std::ferror(file.get())) return false;
    text.resize(got);
    // The file may have grown since its size was taken.
    char chunk[65536];
    while ((got = std::fread(chunk, 1, sizeof chunk, file.get())) > 0) text.append(chunk, got);
    return !std::ferror(file.get());
}

class MFileTable final : public ParametersTableIF {
public:
    MFileTable(std::string filename, std::string text)
        : filename_(std::move(filename)), text_(std::move(text)) {
        IndexLines();
    }

    int GetInt(int line, int column) const override {
        const Field f = Lookup(line, column, KESTREL_HERE);
        return ParseInt(f.text, f, KESTREL_HERE);
    }

    std::string GetString(int line, int column) const override {
        const Field f = Lookup(line, column, KESTREL_HERE);
        return std::string(f.text.begin, f.text.Size());
    }

    unsigned int GetLineCount() const override {
        return static_cast<unsigned int>(lineStarts_.size());
    }

    const std::vector<int>& GetIntList(int line, int column) const override {
        const Field f = Lookup(line, column, KESTREL_HERE);
        listScratch_.clear();
        if (f.text.Empty()) return listScratch_;
        const char* p = f.text.begin;
        for (;;) {
            const char* comma = std::find(p, f.text.end, ',');
            listScratch_.push_back(ParseInt(Trim(Span{p, comma}), f, KESTREL_HERE));
            if (comma == f.text.end) break;
            p = comma + 1;
        }
        return listScratch_;
    }

    void AddDefaultIntList(const std::vector<int>& value) override {
        std::string text;
        for (std::size_t i = 0; i < value.size(); ++i) {
            if (i > 0) text += ',';
            text += std::to_string(value[i]);
        }
        defaults_.push_back(std::move(text));
    }

    void AddDefaultInt(int value) override { defaults_.push_back(std::to_string(value)); }

    void AddDefaultString(const std::string& value) override { defaults_.push_back(value); }

private:
    // A field as it is read: its text, and where it came from for messages.
    struct Field {
        Span text;
        int line;
        int column;
        bool fromDefault;
    };

    void IndexLines() {
        const char* const begin = text_.data();
        const char* const end = begin + text_.size();
        const char* p = begin;
        // A byte order mark written by some Windows editors is not part of the first line.
        if (text_.size() >= 3 && std::memcmp(p, "\xEF\xBB\xBF", 3) == 0) p += 3;
        while (p < end) {
            const char* eol = static_cast<const char*>(std::memchr(p, '\n', end - p));
            if (eol == nullptr) eol = end;
            if (*p != '!') {
                const char* q = p;
                while (q < eol && (IsBlank(*q) || *q == '\r')) ++q;
                if (q < eol) {
                    if (lineStarts_.size() >= static_cast<std::size_t>(INT_MAX)) {
                        KESTREL_THROW(DataException,
                                      FormatString("%s has more data lines than can be indexed",
                                                   filename_.c_str()));
                    }
                    lineStarts_.push_back(static_cast<std::size_t>(p - begin));
                }
            }
            p = eol + 1;
        }
        lineStarts_.shrink_to_fit();
    }

    Field Lookup(int line, int column, const SourceLocation& where) const {
        if (line < 0 || static_cast<std::size_t>(line) >= lineStarts_.size()) {
            KESTREL_THROW_AT(where, DataException,
                             FormatString("%s: data line %d is outside of valid range: %u",
                                          filename_.c_str(), line, GetLineCount()));
        }
        if (column < 0) {
            KESTREL_THROW_AT(where, DataException,
                             FormatString("%s: column %d is not a valid column", filename_.c_str(),
                                          column));
        }
        const char* const end = text_.data() + text_.size();
        const char* p = text_.data() + lineStarts_[static_cast<std::size_t>(line)];
        const char* eol = static_cast<const char*>(std::memchr(p, '\n', end - p));
        if (eol == nullptr) eol = end;
        if (eol != p && eol[-1] == '\r') --eol;

        for (int c = 0; c < column && p != eol; ++c) {
            p = std::find(p, eol, ';');
            if (p != eol) ++p;
            else return DefaultOf(line, column, where);
        }
        const Span text = Trim(Span{p, std::find(p, eol, ';')});
        if (text.Empty()) return DefaultOf(line, column, where);
        return Field{text, line, column, false};
    }

    Field DefaultOf(int line, int column, const SourceLocation& where) const {
        if (static_cast<std::size_t>(column) >= defaults_.size()) {
            KESTREL_THROW_AT(where, DataException,
                             FormatString("%s, line %u, column %d: no value and no default for "
                                          "the column",
                                          filename_.c_str(), FileLineOf(line), column));
        }
        const std::string& d = defaults_[static_cast<std::size_t>(column)];
        return Field{Span{d.data(), d.data() + d.size()}, line, column, true};
    }

    int ParseInt(Span s, const Field& f, const SourceLocation& where) const {
        const char* b = s.begin;
        if (b != s.end && *b == '+') ++b;
        int value = 0;
        const auto result = std::from_chars(b, s.end, value);
        if (s.Empty() || result.ec != std::errc() || result.ptr != s.end) {
            const char* problem = result.ec == std::errc::result_out_of_range
                                      ? "is out of the 32-bit integer range"
                                      : "is not an integer";
            KESTREL_THROW_AT(where, DataException,
                             FormatString("%s, line %u, column %d: \"%s\" %s%s", filename_.c_str(),
                                          FileLineOf(f.line), f.column,
                                          std::string(s.begin, s.Size()).c_str(), problem,
                                          f.fromDefault ? " (the column's default)" : ""));
        }
        return value;
    }

    // The line number in the file (from 1) of a data line; only asked for in messages.
    unsigned int FileLineOf(int line) const {
        const auto start = text_.begin() + static_cast<std::ptrdiff_t>(
                                               lineStarts_[static_cast<std::size_t>(line)]);
        return static_cast<unsigned int>(std::count(text_.begin(), start, '\n')) + 1;
    }

    std::string filename_;
    std::string text_;
    std::vector<std::size_t> lineStarts_;
    std::vector<std::string> defaults_;
    mutable std::vector<int> listScratch_;
};

}  // namespace

ParametersTableIF::~ParametersTableIF() = default;
ParserBuilderIF::~ParserBuilderIF() = default;

MFileParser::MFileParser(int flags) : flags_(flags) {}
MFileParser::~MFileParser() = default;

ParametersTableIF* MFileParser::Create(const std::string& filename) {
    std::string text;
    if (!ReadWholeFile(filename, text)) return nullptr;
    return new MFileTable(filename, std::move(text));
}

}  // namespace kestrel
