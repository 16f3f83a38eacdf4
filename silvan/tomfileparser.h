// The master parameter file of the true-ortho workflow, and the two files derived from it.
#pragma once

#include <memory>
#include <string>

#include <kestrel/exception.h>
#include <kestrel/mfileparser.h>
#include <silvan/export.h>
#include <silvan/filelistparser.h>

namespace kestrel {
namespace processes {
namespace silvan {

// Reads the master parameter file: nine text columns per source image. Values are kept as the
// table gives them; the derived files are typed when they are read again.
class SILVAN_API TOMFileParser : public MFileParser {
  public:
    explicit TOMFileParser(const std::string& filename);
    ~TOMFileParser() override;
    // A copy has its own table, which shares the file's bytes with the original.
    TOMFileParser(const TOMFileParser&);
    TOMFileParser& operator=(const TOMFileParser&);

    unsigned int GetMfileLines() const { return mfileLines; }

    // The values of the last line that a writer read; empty before.
    std::string GetFili() const { return fili; }
    std::string GetDbic() const { return dbic; }
    std::string GetMmseg() const { return mmseg; }
    std::string GetDbiw() const { return dbiw; }
    std::string GetSrcBgd() const { return srcBgd; }
    std::string GetEdgeClip() const { return edgeClip; }
    std::string GetRadioDif() const { return radioDif; }
    std::string GetDbmPxErr() const { return dbmPxErr; }
    std::string GetRole() const { return role; }

    // Writes the preparation parameter file: a header line, then for every line
    // fili;dbic;mmseg;dbiw;srcBgd;edgeClip. Throws FileAccessException when the file cannot be
    // created or written.
    void WriteMFilePrep(const std::string& filename);

    // Writes the image-set file: a header line, then for every line whose upper-cased role does
    // not begin with "PREP" the base name of fili;radioDif;dbmPxErr. Throws FileAccessException
    // when the file cannot be created or written.
    void WriteImgSet(const std::string& filename);

  private:
    TOMFileParser();

    void AddDefaultLine();
    void ParseLineForPrep(const int line);
    void ParseLineForFill(const int line);

    std::string fili;
    std::string dbic;
    std::string mmseg;
    std::string dbiw;
    std::string srcBgd;
    std::string edgeClip;
    std::string radioDif;
    std::string dbmPxErr;
    std::string role;
    unsigned int mfileLines = 0;
    parsercore::OwnedTable table;
};

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
