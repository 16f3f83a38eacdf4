#include <silvan/filelistparser.h>

namespace kestrel {
namespace processes {
namespace silvan {

namespace parsercore {

OwnedTable ReadTable(MFileParser& parser, const std::string& filename, unsigned int& lineCount,
                     const SourceLocation& where) {
    OwnedTable table(parser.Create(filename));
    if (!table) {
        KESTREL_THROW_AT(where, ParameterException, "MFILE", ParameterException::InvalidFile,
                         filename, "", "Invalid MFILE");
    }
    lineCount = table->GetLineCount();
    if (lineCount == 0) {
        KESTREL_THROW_AT(where, ParameterException, "MFILE", ParameterException::InvalidFile,
                         filename, "", "Empty text file");
    }
    return table;
}

void CheckLineIndex(int index, unsigned int lineCount, const SourceLocation& where) {
    const int count = static_cast<int>(lineCount);
    if (index < 0 || index >= count) {
        KESTREL_THROW_AT(where, DataException,
                         FormatString("Index %d is outside of valid range: %d", index, count));
    }
}

}  // namespace parsercore

FileListParser::FileListParser(const std::string& filename) : MFileParser(0) {
    table = parsercore::ReadTable(*this, filename, mfileLines, KESTREL_HERE);
    AddDefaultLine();
}

FileListParser::~FileListParser() = default;
FileListParser::FileListParser(const FileListParser&) = default;
FileListParser& FileListParser::operator=(const FileListParser&) = default;

void FileListParser::AddDefaultLine() {
    table->AddDefaultString("");
}

void FileListParser::ParseLine(int index) {
    parsercore::CheckLineIndex(index, mfileLines, KESTREL_HERE);
    fili = table->GetString(index, 0);
}

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
