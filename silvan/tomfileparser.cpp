#include <silvan/tomfileparser.h>

#include <silvan/filelistparser.h>

#include <kestrel/file.h>

#include <cctype>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <system_error>
#include <utility>

namespace kestrel {
namespace processes {
namespace silvan {

namespace {

enum Column { kFili, kDbic, kMmseg, kDbiw, kSrcBgd, kEdgeClip, kRadioDif, kDbmPxErr, kRole };
constexpr int kColumnCount = 9;

// Writes a text file line by line. Lines are collected in whole and written in batches, so the
// file ends at a line end whenever it is written to, also when a line's values cannot be read
// and the exception unwinds through the writer. Failures to create or write the file are
// reported as FileAccessException at `where`; a file that did not exist before is then removed
// again rather than left half written.
class LineWriter {
  public:
    LineWriter(const std::string& filename, const SourceLocation& where)
        : filename_(filename), where_(where) {
        std::error_code ec;
        existed_ = std::filesystem::exists(std::filesystem::path(filename_), ec);
        file_ = std::fopen(filename_.c_str(), "w");
        if (file_ == nullptr)
            Fail("cannot be created", errno);
        pending_.reserve(kBatchBytes + 4096);
    }

    ~LineWriter() {
        if (file_ == nullptr)
            return;
        // Unwinding from an exception: keep the complete lines collected so far.
        WritePending();
        std::fclose(file_);
    }

    LineWriter(const LineWriter&) = delete;
    LineWriter& operator=(const LineWriter&) = delete;

    // Appends to the current line.
    LineWriter& operator<<(const std::string& text) {
        pending_ += text;
        return *this;
    }
    LineWriter& operator<<(char c) {
        pending_ += c;
        return *this;
    }

    // Ends the current line.
    void EndLine() {
        pending_ += '\n';
        if (pending_.size() >= kBatchBytes && !WritePending())
            Fail("cannot be written", errno);
    }

    // Writes what is left and closes the file.
    void Close() {
        bool ok = WritePending() && std::fflush(file_) == 0;
        int error = ok ? 0 : errno;
        std::FILE* file = std::exchange(file_, nullptr);
        if (std::fclose(file) != 0 && ok) {
            ok = false;
            error = errno;
        }
        if (!ok)
            Fail("cannot be written", error);
    }

  private:
    static constexpr std::size_t kBatchBytes = 1 << 16;

    bool WritePending() {
        const std::size_t size = pending_.size();
        const bool written = size == 0 || std::fwrite(pending_.data(), 1, size, file_) == size;
        pending_.clear();
        return written;
    }

    [[noreturn]] void Fail(const char* what, int error) {
        if (file_ != nullptr) {
            std::fclose(file_);
            file_ = nullptr;
        }
        if (!existed_) {
            std::error_code ec;
            std::filesystem::remove(std::filesystem::path(filename_), ec);
        }
        const std::string reason = error != 0 ? std::generic_category().message(error) : "";
        KESTREL_THROW_AT(where_, FileAccessException, filename_, FileAccessException::CreateFailed,
                         FormatString("\"%s\" %s%s%s", filename_.c_str(), what,
                                      reason.empty() ? "" : ": ", reason.c_str()));
    }

    std::string filename_;
    SourceLocation where_;
    bool existed_ = false;
    std::FILE* file_ = nullptr;
    std::string pending_;
};

}  // namespace

TOMFileParser::TOMFileParser() : MFileParser(0) {}

TOMFileParser::TOMFileParser(const std::string& filename) : MFileParser(0) {
    table = parsercore::ReadTable(*this, filename, mfileLines, KESTREL_HERE);
    AddDefaultLine();
}

TOMFileParser::~TOMFileParser() = default;
TOMFileParser::TOMFileParser(const TOMFileParser&) = default;
TOMFileParser& TOMFileParser::operator=(const TOMFileParser&) = default;

void TOMFileParser::AddDefaultLine() {
    for (int column = 0; column < kColumnCount; ++column)
        table->AddDefaultString("");
}

void TOMFileParser::ParseLineForPrep(const int line) {
    parsercore::CheckLineIndex(line, mfileLines, KESTREL_HERE);
    fili = table->GetString(line, kFili);
    dbic = table->GetString(line, kDbic);
    mmseg = table->GetString(line, kMmseg);
    dbiw = table->GetString(line, kDbiw);
    srcBgd = table->GetString(line, kSrcBgd);
    edgeClip = table->GetString(line, kEdgeClip);
}

void TOMFileParser::ParseLineForFill(const int line) {
    parsercore::CheckLineIndex(line, mfileLines, KESTREL_HERE);
    fili = table->GetString(line, kFili);
    radioDif = table->GetString(line, kRadioDif);
    dbmPxErr = table->GetString(line, kDbmPxErr);
    role = table->GetString(line, kRole);
}

void TOMFileParser::WriteMFilePrep(const std::string& filename) {
    LineWriter out(filename, KESTREL_HERE);
    out << "!MFILE created for VARNOK";
    out.EndLine();
    for (unsigned int line = 0; line < mfileLines; ++line) {
        ParseLineForPrep(static_cast<int>(line));
        out << fili << ';' << dbic << ';' << mmseg << ';' << dbiw << ';' << srcBgd << ';'
            << edgeClip;
        out.EndLine();
    }
    out.Close();
}

void TOMFileParser::WriteImgSet(const std::string& filename) {
    LineWriter out(filename, KESTREL_HERE);
    out << "!IMGSET created for MELDRA";
    out.EndLine();
    for (unsigned int line = 0; line < mfileLines; ++line) {
        ParseLineForFill(static_cast<int>(line));
        for (char& c : role)
            c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
        if (role.compare(0, 4, "PREP") == 0)
            continue;
        const core::fileio::File image(fili);
        out << image.GetBasename() << ';' << radioDif << ';' << dbmPxErr;
        out.EndLine();
    }
    out.Close();
}

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
