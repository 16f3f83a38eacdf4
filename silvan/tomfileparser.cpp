#include <silvan/tomfileparser.h>

#include <silvan/filelistparser.h>

#include <kestrel/file.h>

#include <string>

namespace kestrel {
namespace processes {
namespace silvan {

namespace {

enum Column { kFili, kDbic, kMmseg, kDbiw, kSrcBgd, kEdgeClip, kRadioDif, kDbmPxErr, kRole };
constexpr int kColumnCount = 9;

// Writes a text file line by line, whole or not at all: the lines are collected and written in
// batches to a temporary file that replaces the target only when every line has been written
// (kestrel::core::fileio::ReplacingFile). Any failure, of the disk or of reading a line, leaves
// the previous file as it was.
class LineWriter {
  public:
    LineWriter(const std::string& filename, const SourceLocation& where)
        : file_(filename, where, true) {
        pending_.reserve(kBatchBytes + 4096);
    }

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
        if (pending_.size() >= kBatchBytes)
            WritePending();
    }

    // Writes what is left and puts the file in place.
    void Commit() {
        WritePending();
        file_.Commit();
    }

  private:
    static constexpr std::size_t kBatchBytes = 1 << 16;

    void WritePending() {
        file_.Write(pending_);
        pending_.clear();
    }

    core::fileio::ReplacingFile file_;
    std::string pending_;
};

// toupper as in the "C" locale, whatever the process's locale.
char AsciiUpper(char c) {
    return c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c;
}

// A record whose line would begin with "!" reads back as a comment, so the derived file would
// silently lose it: refused, naming where the value comes from and the file being written.
void RefuseCommentLike(const ParametersTableIF& table, int line, const char* what,
                       const std::string& value, const std::string& output,
                       const SourceLocation& where) {
    if (!value.empty() && value[0] == '!') {
        KESTREL_THROW_AT(where, DataException,
                         FormatString("%s: the %s \"%s\" begins with \"!\", so its record in %s "
                                      "would read back as a comment line; it is not written",
                                      table.DescribePosition(line, kFili).c_str(), what,
                                      value.c_str(), output.c_str()));
    }
}

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
        RefuseCommentLike(*table, static_cast<int>(line), "file name", fili, filename,
                          KESTREL_HERE);
        out << fili << ';' << dbic << ';' << mmseg << ';' << dbiw << ';' << srcBgd << ';'
            << edgeClip;
        out.EndLine();
    }
    out.Commit();
}

void TOMFileParser::WriteImgSet(const std::string& filename) {
    LineWriter out(filename, KESTREL_HERE);
    out << "!IMGSET created for MELDRA";
    out.EndLine();
    for (unsigned int line = 0; line < mfileLines; ++line) {
        ParseLineForFill(static_cast<int>(line));
        for (char& c : role)
            c = AsciiUpper(c);
        if (role.compare(0, 4, "PREP") == 0)
            continue;
        const std::string basename = core::fileio::File(fili).GetBasename();
        RefuseCommentLike(*table, static_cast<int>(line), "base name", basename, filename,
                          KESTREL_HERE);
        out << basename << ';' << radioDif << ';' << dbmPxErr;
        out.EndLine();
    }
    out.Commit();
}

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
