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

bool IsBlank(char c) {
    return c == ' ' || c == '\t';
}

// A piece of the file's text.
struct Span {
    const char* begin;
    const char* end;
    bool Empty() const { return begin == end; }
    std::size_t Size() const { return static_cast<std::size_t>(end - begin); }
};

Span Trim(Span s) {
    while (s.begin != s.end && IsBlank(*s.begin))
        ++s.begin;
    while (s.end != s.begin && IsBlank(s.end[-1]))
        --s.end;
    return s;
}

// The bytes of a file, read whole. Not zero-initialised: every byte is written by the read.
struct FileBytes {
    std::unique_ptr<char[]> data;
    std::size_t size = 0;
};

// Reads the whole file. False when it cannot be opened or read. The table keeps its own copy
// rather than a mapping of the file, so that it stays valid when the file is rewritten.
bool ReadWholeFile(const std::string& filename, FileBytes& bytes) {
    std::error_code ec;
    const std::filesystem::path path(filename);
    if (!std::filesystem::is_regular_file(path, ec))
        return false;
    std::size_t capacity = static_cast<std::size_t>(std::filesystem::file_size(path, ec));
    if (ec)
        return false;

    std::unique_ptr<std::FILE, int (*)(std::FILE*)> file(std::fopen(filename.c_str(), "rb"),
                                                         &std::fclose);
    if (!file)
        return false;
    bytes.data.reset(new char[capacity + 1]);
    bytes.size = 0;
    for (;;) {
        bytes.size +=
            std::fread(bytes.data.get() + bytes.size, 1, capacity + 1 - bytes.size, file.get());
        if (std::ferror(file.get()))
            return false;
        if (bytes.size <= capacity)
            return true;
        // The file has grown since its size was taken: make room and go on reading.
        std::unique_ptr<char[]> larger(new char[2 * capacity + 65536]);
        std::memcpy(larger.get(), bytes.data.get(), bytes.size);
        bytes.data = std::move(larger);
        capacity = 2 * capacity + 65535;
    }
}

class MFileTable final : public ParametersTableIF {
  public:
    MFileTable(std::string filename, FileBytes bytes)
        : filename_(std::move(filename)), bytes_(std::move(bytes)) {
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
        if (f.text.Empty())
            return listScratch_;
        const char* p = f.text.begin;
        for (;;) {
            const char* comma = std::find(p, f.text.end, ',');
            listScratch_.push_back(ParseInt(Trim(Span{p, comma}), f, KESTREL_HERE));
            if (comma == f.text.end)
                break;
            p = comma + 1;
        }
        return listScratch_;
    }

    void AddDefaultIntList(const std::vector<int>& value) override {
        std::string text;
        for (std::size_t i = 0; i < value.size(); ++i) {
            if (i > 0)
                text += ',';
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
        const char* const begin = bytes_.data.get();
        const char* const end = begin + bytes_.size;
        const char* p = begin;
        // A byte order mark written by some Windows editors is not part of the first line.
        if (bytes_.size >= 3 && std::memcmp(p, "\xEF\xBB\xBF", 3) == 0)
            p += 3;
        ReserveLineStarts();
        while (p < end) {
            const char* eol = static_cast<const char*>(std::memchr(p, '\n', end - p));
            if (eol == nullptr)
                eol = end;
            if (*p != '!') {
                const char* q = p;
                while (q < eol && (IsBlank(*q) || *q == '\r'))
                    ++q;
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

    // Reserves room for the line starts from the line length of the file's first bytes, so
    // that a large file is indexed without repeated reallocation.
    void ReserveLineStarts() {
        const std::size_t sample = std::min<std::size_t>(bytes_.size, 1 << 16);
        const char* const begin = bytes_.data.get();
        const auto newlines = static_cast<std::size_t>(std::count(begin, begin + sample, '\n'));
        if (newlines > 0)
            lineStarts_.reserve(bytes_.size / (sample / newlines) + 16);
    }

    Field Lookup(int line, int column, const SourceLocation& where) const {
        if (line < 0 || static_cast<std::size_t>(line) >= lineStarts_.size()) {
            KESTREL_THROW_AT(where, DataException,
                             FormatString("%s: data line %d is outside of valid range: %u",
                                          filename_.c_str(), line, GetLineCount()));
        }
        if (column < 0) {
            KESTREL_THROW_AT(
                where, DataException,
                FormatString("%s: column %d is not a valid column", filename_.c_str(), column));
        }
        const char* const end = bytes_.data.get() + bytes_.size;
        const char* p = bytes_.data.get() + lineStarts_[static_cast<std::size_t>(line)];
        const char* eol = static_cast<const char*>(std::memchr(p, '\n', end - p));
        if (eol == nullptr)
            eol = end;
        if (eol != p && eol[-1] == '\r')
            --eol;

        for (int c = 0; c < column && p != eol; ++c) {
            p = std::find(p, eol, ';');
            if (p != eol)
                ++p;
            else
                return DefaultOf(line, column, where);
        }
        const Span text = Trim(Span{p, std::find(p, eol, ';')});
        if (text.Empty())
            return DefaultOf(line, column, where);
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
        if (b != s.end && *b == '+')
            ++b;
        int value = 0;
        const auto result = std::from_chars(b, s.end, value);
        if (s.Empty() || result.ec != std::errc() || result.ptr != s.end) {
            const char* problem = result.ec == std::errc::result_out_of_range
                                      ? "is out of the 32-bit integer range"
                                      : "is not an integer";
            KESTREL_THROW_AT(
                where, DataException,
                FormatString("%s, line %u, column %d: \"%s\" %s%s", filename_.c_str(),
                             FileLineOf(f.line), f.column, std::string(s.begin, s.Size()).c_str(),
                             problem, f.fromDefault ? " (the column's default)" : ""));
        }
        return value;
    }

    // The line number in the file (from 1) of a data line; only asked for in messages.
    unsigned int FileLineOf(int line) const {
        const char* const begin = bytes_.data.get();
        const char* const start = begin + lineStarts_[static_cast<std::size_t>(line)];
        return static_cast<unsigned int>(std::count(begin, start, '\n')) + 1;
    }

    std::string filename_;
    FileBytes bytes_;
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
    FileBytes bytes;
    if (!ReadWholeFile(filename, bytes))
        return nullptr;
    return new MFileTable(filename, std::move(bytes));
}

}  // namespace kestrel
