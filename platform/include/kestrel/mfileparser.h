// Reader of "MFILE" parameter files into a table of lines and columns.
//
// The grammar is documented in docs/mfile.md. The file is read once, by Create; the table keeps
// the file's bytes and the start of each data line, and reads a field when it is asked for.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include <kestrel/export.h>

namespace kestrel {

// A parsed parameter file. Lines and columns count from 0.
class KESTREL_API ParametersTableIF {
  public:
    virtual ~ParametersTableIF();

    // The field as a signed 32-bit integer. Throws DataException when it is not one.
    virtual int GetInt(int line, int column) const = 0;
    // The field's text, with blanks and tabs around it removed. Throws DataException when it holds
    // a control byte other than tab.
    virtual std::string GetString(int line, int column) const = 0;
    // The number of data lines.
    virtual unsigned int GetLineCount() const = 0;
    // The field as a comma-separated list of integers. The list belongs to the table and is
    // overwritten by the next call on the same table: copy it at once.
    virtual const std::vector<int>& GetIntList(int line, int column) const = 0;
    // Each call appends the default of the next column: the value a line reads when it leaves
    // the column out or empty.
    virtual void AddDefaultIntList(const std::vector<int>& value) = 0;
    virtual void AddDefaultInt(int value) = 0;
    virtual void AddDefaultString(const std::string& value) = 0;

    // The operations below follow those above, which keep their order.

    // A new table, owned by the caller, that reads the same file with the same defaults. The
    // file's bytes are shared, not copied; no state that a getter writes is shared, so the two
    // tables may be used on two threads at once.
    virtual ParametersTableIF* Clone() const = 0;
    // Where a value stands, for messages: "file, line L, column C", L being the line's number
    // in the file (from 1, counting header and blank lines).
    virtual std::string DescribePosition(int line, int column) const = 0;

  protected:
    ParametersTableIF() = default;
    ParametersTableIF(const ParametersTableIF&) = default;
    ParametersTableIF& operator=(const ParametersTableIF&) = default;
};

class KESTREL_API ParserBuilderIF {
  public:
    virtual ~ParserBuilderIF();

  protected:
    ParserBuilderIF() = default;
    ParserBuilderIF(const ParserBuilderIF&) = default;
    ParserBuilderIF& operator=(const ParserBuilderIF&) = default;
};

class KESTREL_API MFileParser : public ParserBuilderIF {
  public:
    // The flags are reserved; the parsers of this suite pass 0.
    explicit MFileParser(int flags);
    ~MFileParser() override;
    MFileParser(const MFileParser&) = default;
    MFileParser& operator=(const MFileParser&) = default;

    // Files larger than this are refused rather than read into memory.
    static constexpr unsigned long long kMaxFileBytes = 256ull << 20;

    // Reads the whole file: a regular file or anything else that can be read to its end, such
    // as a pipe. Returns a new table that the caller owns, or null when the file cannot be
    // opened or read (a directory, a missing file). Throws FileAccessException for a file of
    // more than kMaxFileBytes.
    virtual ParametersTableIF* Create(const std::string& filename);

    int GetFlags() const { return flags_; }

  private:
    std::int32_t flags_;
};

}  // namespace kestrel
