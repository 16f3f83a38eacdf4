#include <silvan/parserfactory.h>

#include <kestrel/disk.h>

#include <memory>

namespace kestrel {
namespace processes {
namespace silvan {

namespace {

void CheckFilename(const std::string& filename, const char* parameterName,
                   const SourceLocation& where) {
    if (filename.empty()) {
        KESTREL_THROW_AT(where, ParameterException, parameterName, ParameterException::EmptyValue,
                         filename, "", "Empty filename");
    }
}

}  // namespace

FileListParser* ParserFactory::CreateFileListParser(const std::string& filename) {
    CheckFilename(filename, "mfile", KESTREL_HERE);
    return new FileListParser(filename);
}

TOImgSetParser* ParserFactory::CreateImgSetParser(const std::string& filename,
                                                  RadiometricDiff radioDif, int dbmPxErr) {
    CheckFilename(filename, "ImgSet", KESTREL_HERE);
    return new TOImgSetParser(filename, radioDif, dbmPxErr);
}

TOSceneParser* ParserFactory::CreateSceneParser(const std::string& filename) {
    CheckFilename(filename, "SceneXML", KESTREL_HERE);
    auto scene = std::make_unique<TOSceneParser>();
    scene->SetXMLFilename(filename);
    if (DKCheck(filename.c_str()) != 0)
        scene->Serialize(true);
    return scene.release();
}

TOMFileParser* ParserFactory::CreateTOMFileParser(const std::string& filename) {
    CheckFilename(filename, "mfile", KESTREL_HERE);
    return new TOMFileParser(filename);
}

TPMFileParser* ParserFactory::CreateTPMFileParser(const std::string& filename,
                                                  std::vector<unsigned int>& dbic, int mmseg,
                                                  std::vector<int>& dbiw, const std::string& srcBgd,
                                                  int edgeClip) {
    CheckFilename(filename, "mfile", KESTREL_HERE);
    return new TPMFileParser(filename, dbic, mmseg, dbiw, srcBgd, edgeClip);
}

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
