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

// The first line end (LF, or CR alone or before LF) in [p, end), or null.
const char* FindLineEnd(const char* p, const char* end) {
    const char* lf = static_cast<const char*>(std::memchr(p, '\n', end - p));
    // Carriage returns are rare: look for one only before the next line feed.
    const char* cr = static_cast<const char*>(std::memchr(p, '\r', (lf ? lf : end) - p));
    return cr != nullptr ? cr : lf;
}

Span Trim(Span s) {
    while (s.begin != s.end && IsBlank(*s.begin))
        ++s.begin;
    while (s.end != s.begin && IsBlank(s.end[-1]))
        --s.end;
    return s;
}

// A parameter file as read: its name, its bytes, and the offset of each data line in them.
// Never changed once read, so that tables may share it across threads.
struct LoadedFile {
    std::string filename;
    std::unique_ptr<char[]> bytes;  // not zero-initialised: every byte is written by the read
    std::size_t size = 0;
    std::vector<std::size_t> lineStarts;
};

// Collects the starts of the data lines while the file's bytes arrive, so that each chunk is
// indexed while it is still in the processor's cache.
class LineIndexer {
  public:
    LineIndexer(const std::string& filename, std::vector<std::size_t>& starts)
        : filename_(filename), starts_(starts) {}

    // Indexes the lines that end in bytes [scanned, size) of the file read so far.
    void Scan(const char* bytes, std::size_t size) {
        // A byte order mark written by some Windows editors is not part of the first line.
        if (scanned_ == 0 && size >= 3 && std::memcmp(bytes, "\xEF\xBB\xBF", 3) == 0)
            scanned_ = lineStart_ = 3;
        const char* const end = bytes + size;
        const char* p = bytes + scanned_;
        while (p < end) {
            const char* eol = FindLineEnd(p, end);
            if (eol == nullptr) {
                p = end;
                break;
            }
            if (*eol == '\r' && eol + 1 == end)
                break;  // whether a line feed follows is known with the next bytes
            const char* next = eol + 1 + (*eol == '\r' && eol[1] == '\n' ? 1 : 0);
            AddLine(bytes, static_cast<std::size_t>(eol - bytes),
                    static_cast<std::size_t>(next - bytes));
            p = next;
        }
        scanned_ = static_cast<std::size_t>(p - bytes);
    }

    // Indexes a last line that has no line end, or ends in a carriage return.
    void Finish(const char* bytes, std::size_t size) {
        if (lineStart_ < size) {
            const bool cr = scanned_ + 1 == size && bytes[scanned_] == '\r';
            AddLine(bytes, cr ? scanned_ : size, size);
        }
    }

  private:
    // Records the line [lineStart_, eol) when it is a data line: not a "!" line, not blank.
    // The next line starts at next.
    void AddLine(const char* bytes, std::size_t eol, std::size_t next) {
        const std::size_t start = lineStart_;
        lineStart_ = next;
        if (start == eol || bytes[start] == '!')
            return;
        const char* q = bytes + start;
        while (q < bytes + eol && IsBlank(*q))
            ++q;
        if (q == bytes + eol)
            return;
        if (starts_.size() >= static_cast<std::size_t>(INT_MAX)) {
            KESTREL_THROW(DataException, FormatString("%s has more data lines than can be indexed",
                                                      filename_.c_str()));
        }
        starts_.push_back(start);
    }

    const std::string& filename_;
    std::vector<std::size_t>& starts_;
    std::size_t lineStart_ = 0;
    std::size_t scanned_ = 0;
};

[[noreturn]] void ThrowTooLarge(const std::string& filename) {
    KESTREL_THROW(FileAccessException, filename, FileAccessException::ReadFailed,
                  FormatString("%s is larger than %llu MiB, the most that a parameter file may "
                               "hold; it is not read",
                               filename.c_str(), MFileParser::kMaxFileBytes >> 20));
}

// Reads the whole file and indexes its data lines. False when it cannot be opened or read. The
// table keeps its own copy rather than a mapping of the file, so that it stays valid when the
// file is rewritten while it is in use. Pipes and devices are read to their end, up to the
// size limit.
bool LoadFile(const std::string& filename, LoadedFile& loaded) {
    constexpr std::size_t kLimit = static_cast<std::size_t>(MFileParser::kMaxFileBytes);
    std::error_code ec;
    const std::filesystem::path path(filename);
    const std::filesystem::file_status status = std::filesystem::status(path, ec);
    if (ec || !std::filesystem::exists(status) || std::filesystem::is_directory(status))
        return false;
    std::size_t capacity = 0;  // unknown for what is not a regular file
    if (std::filesystem::is_regular_file(status)) {
        const std::uintmax_t size = std::filesystem::file_size(path, ec);
        if (ec)
            return false;
        if (size > kLimit)
            ThrowTooLarge(filename);
        capacity = static_cast<std::size_t>(size);
    }
    std::unique_ptr<std::FILE, int (*)(std::FILE*)> file(std::fopen(filename.c_str(), "rb"),
                                                         &std::fclose);
    if (!file)
        return false;

    constexpr std::size_t kChunk = 1 << 18;
    loaded.bytes.reset(new char[capacity + 1]);
    loaded.size = 0;
    loaded.lineStarts.reserve(capacity / 48 + 16);  // a typical line is longer than 48 bytes
    LineIndexer indexer(filename, loaded.lineStarts);
    for (;;) {
        if (loaded.size == capacity + 1) {
            // The file has grown since its size was taken: make room and go on reading.
            const std::size_t larger = std::min(2 * capacity + kChunk, kLimit);
            std::unique_ptr<char[]> bytes(new char[larger + 1]);
            std::memcpy(bytes.get(), loaded.bytes.get(), loaded.size);
            loaded.bytes = std::move(bytes);
            capacity = larger;
        }
        const std::size_t want = std::min(kChunk, capacity + 1 - loaded.size);
        const std::size_t got = std::fread(loaded.bytes.get() + loaded.size, 1, want, file.get());
        if (std::ferror(file.get()))
            return false;
        if (got == 0)
            break;
        loaded.size += got;
        if (loaded.size > kLimit)
            ThrowTooLarge(filename);
        indexer.Scan(loaded.bytes.get(), loaded.size);
    }
    indexer.Finish(loaded.bytes.get(), loaded.size);
    if (loaded.lineStarts.capacity() > loaded.lineStarts.size() + loaded.lineStarts.size() / 4)
        loaded.lineStarts.shrink_to_fit();
    return true;
}

class MFileTable final : public ParametersTableIF {
  public:
    explicit MFileTable(std::shared_ptr<const LoadedFile> file) : file_(std::move(file)) {}

    int GetInt(int line, int column) const override {
        const Field f = Lookup(line, column, KESTREL_HERE);
        return ParseInt(f.text, f, KESTREL_HERE);
    }

    std::string GetString(int line, int column) const override {
        const Field f = Lookup(line, column, KESTREL_HERE);
        return std::string(f.text.begin, f.text.Size());
    }

    unsigned int GetLineCount() const override {
        return static_cast<unsigned int>(file_->lineStarts.size());
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

    // The copy shares the file's bytes, which never change, and has its own defaults and list.
    ParametersTableIF* Clone() const override {
        auto copy = std::make_unique<MFileTable>(file_);
        copy->defaults_ = defaults_;
        return copy.release();
    }

    std::string DescribePosition(int line, int column) const override {
        if (line < 0 || static_cast<std::size_t>(line) >= file_->lineStarts.size())
            return FormatString("%s, data line %d, column %d", Name(), line, column);
        return FormatString("%s, line %u, column %d", Name(), FileLineOf(line), column);
    }

  private:
    // A field as it is read: its text, and where it came from for messages.
    struct Field {
        Span text;
        int line;
        int column;
        bool fromDefault;
    };

    Field Lookup(int line, int column, const SourceLocation& where) const {
        if (line < 0 || static_cast<std::size_t>(line) >= file_->lineStarts.size()) {
            KESTREL_THROW_AT(where, DataException,
                             FormatString("%s: data line %d is outside of valid range: %u", Name(),
                                          line, GetLineCount()));
        }
        if (column < 0) {
            KESTREL_THROW_AT(where, DataException,
                             FormatString("%s: column %d is not a valid column", Name(), column));
        }
        const char* const end = file_->bytes.get() + file_->size;
        const char* p = file_->bytes.get() + file_->lineStarts[static_cast<std::size_t>(line)];
        const char* eol = FindLineEnd(p, end);
        if (eol == nullptr)
            eol = end;

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
        // A control byte would be cut off or misread by whoever uses the value as a C string or
        // as text; only tab, which a field may hold inside, passes.
        for (const char* q = text.begin; q != text.end; ++q) {
            const unsigned char c = static_cast<unsigned char>(*q);
            if ((c < 0x20 && c != '\t') || c == 0x7F) {
                const char* const lineStart =
                    file_->bytes.get() + file_->lineStarts[static_cast<std::size_t>(line)];
                // Text files hold no NUL: say plainly that this is a binary file (an image
                // named where a parameter file was expected, most often).
                KESTREL_THROW_AT(
                    where, DataException,
                    FormatString("%s, line %u, column %d: the value holds the control "
                                 "byte 0x%02X at character %lld of the line; only "
                                 "tab is allowed%s",
                                 Name(), FileLineOf(line), column, static_cast<unsigned int>(c),
                                 static_cast<long long>(q - lineStart) + 1,
                                 c == 0 ? " (a binary file, such as an image, is no parameter "
                                          "file)"
                                        : ""));
            }
        }
        return Field{text, line, column, false};
    }

    Field DefaultOf(int line, int column, const SourceLocation& where) const {
        if (static_cast<std::size_t>(column) >= defaults_.size()) {
            KESTREL_THROW_AT(where, DataException,
                             FormatString("%s, line %u, column %d: no value and no default for "
                                          "the column",
                                          Name(), FileLineOf(line), column));
        }
        const std::string& d = defaults_[static_cast<std::size_t>(column)];
        return Field{Span{d.data(), d.data() + d.size()}, line, column, true};
    }

    int ParseInt(Span s, const Field& f, const SourceLocation& where) const {
        // One sign at most: from_chars takes "-" but not "+", so "+" is skipped here, and must
        // not be followed by another sign.
        const char* b = s.begin;
        if (b != s.end && *b == '+')
            ++b;
        int value = 0;
        const auto result = std::from_chars(b, s.end, value);
        const bool twoSigns = b != s.begin && b != s.end && *b == '-';
        if (s.Empty() || twoSigns || result.ec != std::errc() || result.ptr != s.end) {
            const char* problem = result.ec == std::errc::result_out_of_range
                                      ? "is out of the 32-bit integer range"
                                      : "is not an integer";
            KESTREL_THROW_AT(
                where, DataException,
                FormatString("%s, line %u, column %d: \"%s\" %s%s", Name(), FileLineOf(f.line),
                             f.column, std::string(s.begin, s.Size()).c_str(), problem,
                             f.fromDefault ? " (the column's default)" : ""));
        }
        return value;
    }

    // The line number in the file (from 1) of a data line; only asked for in messages. Counts
    // line feeds and carriage returns, a CR LF pair once.
    unsigned int FileLineOf(int line) const {
        const char* p = file_->bytes.get();
        const char* const start = p + file_->lineStarts[static_cast<std::size_t>(line)];
        unsigned int number = 1;
        while (p < start) {
            const char* eol = FindLineEnd(p, start);
            if (eol == nullptr)
                break;
            ++number;
            p = eol + 1 + (*eol == '\r' && eol + 1 < start && eol[1] == '\n' ? 1 : 0);
        }
        return number;
    }

    const char* Name() const { return file_->filename.c_str(); }

    std::shared_ptr<const LoadedFile> file_;
    std::vector<std::string> defaults_;
    // Written by GetIntList, so never shared: each table, clones included, has its own.
    mutable std::vector<int> listScratch_;
};

}  // namespace

ParametersTableIF::~ParametersTableIF() = default;
ParserBuilderIF::~ParserBuilderIF() = default;

MFileParser::MFileParser(int flags) : flags_(flags) {}
MFileParser::~MFileParser() = default;

ParametersTableIF* MFileParser::Create(const std::string& filename) {
    auto file = std::make_shared<LoadedFile>();
    file->filename = filename;
    if (!LoadFile(filename, *file))
        return nullptr;
    return new MFileTable(std::move(file));
}

}  // namespace kestrel
