// The parser core shared by the parameter-file parsers, and the file-list parser.
#pragma once

#include <memory>
#include <string>

#include <kestrel/exception.h>
#include <kestrel/mfileparser.h>
#include <silvan/export.h>

namespace kestrel {
namespace processes {
namespace silvan {

namespace parsercore {

// Has the parser read filename into a table. Throws ParameterException "Invalid MFILE" when no
// table is obtained and "Empty text file" when it has no line (releasing it); both are reported
// at `where`, the constructor that reads. On success lineCount holds the table's line count.
std::shared_ptr<ParametersTableIF> ReadTable(MFileParser& parser, const std::string& filename,
                                             unsigned int& lineCount, const SourceLocation& where);

// Throws DataException "Index %d is outside of valid range: %d" at `where` unless
// 0 <= index < lineCount, both compared as signed 32-bit integers.
void CheckLineIndex(int index, unsigned int lineCount, const SourceLocation& where);

}  // namespace parsercore

// A list of file names, one per line.
class SILVAN_API FileListParser : public MFileParser {
  public:
    explicit FileListParser(const std::string& filename);
    ~FileListParser() override;
    // Copies share the table; it is released with the last of them.
    FileListParser(const FileListParser&);
    FileListParser& operator=(const FileListParser&);

    // Makes the line with this index (from 0) the current line.
    void ParseLine(int index);

    std::string GetFili() const { return fili; }
    unsigned int GetMfileLines() const { return mfileLines; }

  private:
    void AddDefaultLine();

    std::string fili;
    unsigned int mfileLines = 0;
    std::shared_ptr<ParametersTableIF> table;
};

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
