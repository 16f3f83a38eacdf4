#include <silvan/tpmfileparser.h>

#include <kestrel/channels.h>
#include <silvan/filelistparser.h>

namespace kestrel {
namespace processes {
namespace silvan {

TPMFileParser::TPMFileParser(const std::string& filename, std::vector<unsigned int>& defaultDbic,
                             int defaultMmseg, std::vector<int>& defaultDbiw,
                             const std::string& defaultSrcBgd, int defaultEdgeClip)
    : MFileParser(0) {
    table = parsercore::ReadTable(*this, filename, mfileLines, KESTREL_HERE);
    AddDefaultLine(defaultDbic, defaultMmseg, defaultDbiw, defaultSrcBgd, defaultEdgeClip);
}

TPMFileParser::~TPMFileParser() = default;
TPMFileParser::TPMFileParser(const TPMFileParser&) = default;
TPMFileParser& TPMFileParser::operator=(const TPMFileParser&) = default;

void TPMFileParser::AddDefaultLine(std::vector<unsigned int>& dbicDefault, int mmsegDefault,
                                   std::vector<int>& dbiwDefault, const std::string& srcBgdDefault,
                                   int edgeClipDefault) {
    // The table holds integer lists; each channel number keeps its 32-bit pattern, so a number
    // above INT_MAX reads back negative and is refused by ExpandChannelList, not wrapped.
    std::vector<int> dbicSigned;
    dbicSigned.reserve(dbicDefault.size());
    for (const unsigned int channel : dbicDefault)
        dbicSigned.push_back(static_cast<int>(channel));

    table->AddDefaultString("");
    table->AddDefaultIntList(dbicSigned);
    table->AddDefaultInt(mmsegDefault);
    table->AddDefaultIntList(dbiwDefault);
    table->AddDefaultString(srcBgdDefault);
    table->AddDefaultInt(edgeClipDefault);
}

void TPMFileParser::ParseLine(const int line) {
    parsercore::CheckLineIndex(line, mfileLines, KESTREL_HERE);
    fili = table->GetString(line, 0);
    // The table's list is overwritten by its next read: copy it before anything else reads.
    const std::vector<int> channels = table->GetIntList(line, 1);
    ExpandChannelList(channels, dbic);
    mmseg = table->GetInt(line, 2);
    dbiw = table->GetIntList(line, 3);
    srcBgd = table->GetString(line, 4);
    edgeClip = table->GetInt(line, 5);
}

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
