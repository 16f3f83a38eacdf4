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

// The table a parser owns. A copy owns a clone of the table, which shares the file's bytes but
// nothing that a getter writes, so that copies of a parser may be used on different threads.
class OwnedTable {
  public:
    OwnedTable() = default;
    explicit OwnedTable(ParametersTableIF* table) : table_(table) {}
    OwnedTable(const OwnedTable& other) : table_(other.table_ ? other.table_->Clone() : nullptr) {}
    OwnedTable& operator=(const OwnedTable& other) {
        if (this != &other)
            table_.reset(other.table_ ? other.table_->Clone() : nullptr);
        return *this;
    }
    OwnedTable(OwnedTable&&) noexcept = default;
    OwnedTable& operator=(OwnedTable&&) noexcept = default;
    ~OwnedTable() = default;

    ParametersTableIF* operator->() const { return table_.get(); }
    ParametersTableIF& operator*() const { return *table_; }
    explicit operator bool() const { return table_ != nullptr; }

  private:
    std::unique_ptr<ParametersTableIF> table_;
};

// Has the parser read filename into a table. Throws ParameterException "Invalid MFILE" when no
// table is obtained and "Empty text file" when it has no line (releasing it); both are reported
// at `where`, the constructor that reads. On success lineCount holds the table's line count.
OwnedTable ReadTable(MFileParser& parser, const std::string& filename, unsigned int& lineCount,
                     const SourceLocation& where);

// Throws DataException "Index %d is outside of valid range: %d" at `where` unless
// 0 <= index < lineCount, both compared as signed 32-bit integers.
void CheckLineIndex(int index, unsigned int lineCount, const SourceLocation& where);

}  // namespace parsercore

// A list of file names, one per line.
class SILVAN_API FileListParser : public MFileParser {
  public:
    explicit FileListParser(const std::string& filename);
    ~FileListParser() override;
    // A copy has its own table, which shares the file's bytes with the original.
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
    parsercore::OwnedTable table;
};

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
