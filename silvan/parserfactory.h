// The one place where a process obtains a parser for one of its input files.
#pragma once

#include <string>
#include <vector>

#include <silvan/export.h>
#include <silvan/filelistparser.h>
#include <silvan/toimgsetparser.h>
#include <silvan/tomfileparser.h>
#include <silvan/tosceneparser.h>
#include <silvan/tpmfileparser.h>

namespace kestrel {
namespace processes {
namespace silvan {

// Every operation refuses an empty file name with ParameterException "Empty filename" (type 3)
// and returns a new parser that the caller owns and deletes. When a parser's constructor or
// reading throws, nothing is left allocated and the exception reaches the caller unchanged.
class SILVAN_API ParserFactory {
  public:
    ParserFactory& operator=(const ParserFactory&) { return *this; }

    static FileListParser* CreateFileListParser(const std::string& filename);

    static TOImgSetParser* CreateImgSetParser(const std::string& filename, RadiometricDiff radioDif,
                                              int dbmPxErr);

    // A scene parser holding the name; filled from the file when the file exists, otherwise
    // empty, to be filled through its setters.
    static TOSceneParser* CreateSceneParser(const std::string& filename);

    static TOMFileParser* CreateTOMFileParser(const std::string& filename);

    // The arguments after the file name are the defaults of the preparation file's columns.
    static TPMFileParser* CreateTPMFileParser(const std::string& filename,
                                              std::vector<unsigned int>& dbic, int mmseg,
                                              std::vector<int>& dbiw, const std::string& srcBgd,
                                              int edgeClip);
};

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
