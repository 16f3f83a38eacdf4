// The parameter file of the preparation process: per source image its file name, channels,
// math-model segment, dbiw list, background value and edge clipping, typed.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include <kestrel/mfileparser.h>
#include <silvan/export.h>
#include <silvan/filelistparser.h>

namespace kestrel {
namespace processes {
namespace silvan {

class SILVAN_API TPMFileParser : public MFileParser {
  public:
    // The default arguments are the process's own settings: the values of a line that leaves
    // columns 1 to 5 out or empty. The lists are only read.
    TPMFileParser(const std::string& filename, std::vector<unsigned int>& defaultDbic,
                  int defaultMmseg, std::vector<int>& defaultDbiw, const std::string& defaultSrcBgd,
                  int defaultEdgeClip);
    ~TPMFileParser() override;
    // A copy has its own table, which shares the file's bytes with the original.
    TPMFileParser(const TPMFileParser&);
    TPMFileParser& operator=(const TPMFileParser&);

    // Makes the line with this index (from 0) the current line. The channel list is expanded
    // by ExpandChannelList (kestrel/channels.h).
    void ParseLine(const int line);

    std::string GetFili() const { return fili; }
    std::vector<unsigned int> GetDbic() const { return dbic; }
    int GetMmseg() const { return mmseg; }
    std::vector<int> GetDbiw() const { return dbiw; }
    std::string GetSrcBgd() const { return srcBgd; }
    int GetEdgeClip() const { return edgeClip; }
    unsigned int GetMfileLines() const { return mfileLines; }

  private:
    // A parser exists only for a file that has been read.
    TPMFileParser() = delete;

    void AddDefaultLine(std::vector<unsigned int>& dbicDefault, int mmsegDefault,
                        std::vector<int>& dbiwDefault, const std::string& srcBgdDefault,
                        int edgeClipDefault);

    std::string fili;
    std::vector<unsigned int> dbic;
    int mmseg = 0;
    std::vector<int> dbiw;
    std::string srcBgd;
    int edgeClip = 0;
    unsigned int mfileLines = 0;
    parsercore::OwnedTable table;
};

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
