#include <silvan/tosceneparser.h>

#include <climits>
#include <cstdio>
#include <cstdlib>
#include <locale>
#include <sstream>
#include <vector>

#include <kestrel/disk.h>
#include <kestrel/file.h>
#include <kestrel/stringlist.h>
#include <silvan/utils.h>

namespace kestrel {
namespace processes {
namespace silvan {

namespace {

using Footprint = kestrel::tin::Polygon<double>;

const char kDocName[] = "TOSceneDesc_Document";
const char kDtdName[] = "TOSceneDesc_Document.dtd";

// The DTD, written exactly as it stands here.
const char* const kDtdText[] = {
    "<?xml version=\"1.0\" encoding=\"ISO-8859-1\"?>\n\n",
    "<!-- True Ortho Scene Description File -->\n",
    ("<!ELEMENT TOSceneDesc_Document (SourceRaster | OrthoRaster | VisIdxmapRaster | "
     "ElevMapRaster | Mmseg | OrthoNoDataValue | ElevNoDataValue | SceneFootprint)*>\n"),
    "<!ELEMENT SourceRaster (#PCDATA)>\n",
    "<!ELEMENT OrthoRaster (#PCDATA)>\n",
    "<!ELEMENT VisIdxmapRaster (#PCDATA)>\n",
    "<!ELEMENT ElevMapRaster (#PCDATA)>\n",
    "<!ELEMENT Mmseg (#PCDATA)>\n",
    "<!ELEMENT OrthoNoDataValue (#PCDATA)>\n",
    "<!ELEMENT ElevNoDataValue (#PCDATA)>\n",
    "<!ELEMENT SceneFootprint ((Pt*))>\n",
    "<!ELEMENT Pt (#PCDATA)>\n",
};

// atoi's reading (leading number, 0 when none), with values beyond int clamped instead of
// undefined.
int TextToInt(const std::string& text) {
    const long value = std::strtol(text.c_str(), nullptr, 10);
    if (value > INT_MAX)
        return INT_MAX;
    if (value < INT_MIN)
        return INT_MIN;
    return static_cast<int>(value);
}

// atof's reading in the "C" locale, whatever the process's locale: the writer writes with ".".
float TextToFloat(const std::string& text) {
    return static_cast<float>(ClassicAtof(text.c_str()));
}

}  // namespace

TOSceneParser::TOSceneParser() : XMLParser() {
    Init();
}

TOSceneParser::TOSceneParser(const char* xmlFilename) : XMLParser(xmlFilename) {
    Init();
    Serialize(true);
}

TOSceneParser::~TOSceneParser() = default;

void TOSceneParser::Init() {
    sceneFilename.clear();
    orthoFilename.clear();
    visIdxFilename.clear();
    elevMapFilename.clear();
    mmseg = -1;
    orthoNoDataValue = 0.0f;
    elevNoDataValue = -32768.0f;
    sceneFootprint.reset();
}

void TOSceneParser::SetSceneFootprint(const Footprint* footprint) {
    if (footprint == nullptr) {
        KESTREL_THROW(DataException, "No footprint polygon was given to the scene");
    }
    // The copy is made before the held polygon is released: the argument may be that polygon.
    sceneFootprint = std::make_unique<Footprint>(*footprint);
}

// ---------------------------------------------------------------------------------------------
// Reading

void TOSceneParser::ReadXMLFile() {
    const bool complete = GetSceneFilenameFromXML() && GetOrthoFilenameFromXML() &&
                          GetVisIdxFilenameFromXML() && GetElevMapFilenameFromXML() &&
                          GetSceneFootprintFromXML();
    if (!complete) {
        KESTREL_THROW(FileAccessException, "", FileAccessException::ReadFailed,
                      FormatString(_(" Error in parsing %s XML file. Some tags are missing.\n"),
                                   GetXMLFilename().c_str()));
    }
    GetMmsegFromXML();
    GetOrthoNoDataValueFromXML();
    GetElevNoDataValueFromXML();
}

bool TOSceneParser::GetSceneFilenameFromXML() {
    return ReadTagFromFile("SourceRaster", &sceneFilename);
}

bool TOSceneParser::GetOrthoFilenameFromXML() {
    return ReadTagFromFile("OrthoRaster", &orthoFilename);
}

bool TOSceneParser::GetVisIdxFilenameFromXML() {
    return ReadTagFromFile("VisIdxmapRaster", &visIdxFilename);
}

bool TOSceneParser::GetElevMapFilenameFromXML() {
    return ReadTagFromFile("ElevMapRaster", &elevMapFilename);
}

bool TOSceneParser::GetMmsegFromXML() {
    std::string text;
    const bool found = ReadTagFromFile("Mmseg", &text);
    if (found && !text.empty())
        mmseg = TextToInt(text);
    return found;
}

bool TOSceneParser::GetOrthoNoDataValueFromXML() {
    std::string text;
    const bool found = ReadTagFromFile("OrthoNoDataValue", &text);
    if (found && !text.empty())
        orthoNoDataValue = TextToFloat(text);
    return found;
}

bool TOSceneParser::GetElevNoDataValueFromXML() {
    std::string text;
    const bool found = ReadTagFromFile("ElevNoDataValue", &text);
    if (found && !text.empty())
        elevNoDataValue = TextToFloat(text);
    return found;
}

bool TOSceneParser::GetSceneFootprintFromXML() {
    std::vector<std::string> texts;
    const bool found = ReadTagFromFile("Pt", &texts);

    const unsigned int count = static_cast<unsigned int>(texts.size());
    std::unique_ptr<point2_t<double>[]> points(new point2_t<double>[count]);
    for (unsigned int i = 0; i < count; ++i) {
        // x and y are the first two tokens; an absent or blank one is refused rather than read
        // as 0. Tokens that are not numbers read as the C library reads them.
        const std::vector<std::string> tokens = TokenizeStr(texts[i], "\t,;");
        if (tokens.size() < 2 || tokens[0].empty() || tokens[1].empty()) {
            KESTREL_THROW(DataException,
                          FormatString(_("Error in parsing %s XML file: the footprint point "
                                         "\"%s\" does not hold two coordinates"),
                                       GetXMLFilename().c_str(), texts[i].c_str()));
        }
        points[i].x = ClassicAtof(tokens[0].c_str());
        points[i].y = ClassicAtof(tokens[1].c_str());
    }
    // The polygon takes the array over once it is built.
    std::unique_ptr<Footprint> footprint(new Footprint(points.get(), count));
    points.release();
    sceneFootprint = std::move(footprint);
    return found;
}

// ---------------------------------------------------------------------------------------------
// Writing

std::string TOSceneParser::GetDocNameTag() const {
    return kDocName;
}

XERCES_CPP_NAMESPACE::DOMDocumentType* TOSceneParser::GetDOMDocumenType() const {
    const std::string directory = core::fileio::File(GetXMLFilename()).GetAbsolutePath();
    const std::string systemId = core::fileio::File(kDtdName).GetNormalizedName();
    // The DTD belongs beside the XML file, whatever the current directory is.
    if (!core::fileio::File(directory + kDtdName).Exists())
        CreateDTDFile(directory);
    return KESTREL_XMLUtil::CreateDocumentType(kDocName, "", systemId);
}

void TOSceneParser::CreateDTDFile(const std::string& directory) const {
    const std::string path = core::fileio::File(directory + kDocName + ".dtd").GetNormalizedName();
    // Written completely now, put in place by the base together with the XML file, and never
    // left behind by a writing that fails.
    std::unique_ptr<core::fileio::ReplacingFile> dtd;
    try {
        dtd = std::make_unique<core::fileio::ReplacingFile>(path, KESTREL_HERE, true);
        for (const char* text : kDtdText)
            dtd->Write(text);
        dtd->Close();
    } catch (const Exception& e) {
        KESTREL_THROW(FileAccessException, path, FileAccessException::CreateFailed,
                      FormatString(_(" Scene XML file: %s couldn't be created because\n %s\n"),
                                   path.c_str(), e.what()));
    }
    KeepWithXMLFile(std::move(dtd));
}

void TOSceneParser::AddElementsToDocument() {
    const struct {
        const char* tag;
        const std::string& value;
    } names[] = {{"SourceRaster", sceneFilename},
                 {"OrthoRaster", orthoFilename},
                 {"VisIdxmapRaster", visIdxFilename},
                 {"ElevMapRaster", elevMapFilename}};
    for (const auto& name : names) {
        if (name.value.find('\0') != std::string::npos) {
            KESTREL_THROW(DataException,
                          FormatString(_("Scene XML file %s: the %s name holds a NUL byte, which "
                                         "XML cannot hold"),
                                       GetXMLFilename().c_str(), name.tag));
        }
        AddElement(name.tag, name.value.c_str());
    }

    std::ostringstream stream;
    stream.imbue(std::locale::classic());
    if (mmseg > 0) {
        stream << mmseg;
        AddElement("Mmseg", stream.str().c_str());
    }
    stream.str("");
    stream << orthoNoDataValue;
    AddElement("OrthoNoDataValue", stream.str().c_str());
    stream.str("");
    stream << elevNoDataValue;
    AddElement("ElevNoDataValue", stream.str().c_str());

    std::vector<std::string> points;
    stream.precision(20);
    if (sceneFootprint) {
        points.reserve(sceneFootprint->numPoints);
        for (unsigned int i = 0; i < sceneFootprint->numPoints; ++i) {
            stream.str("");
            stream << sceneFootprint->points[i].x << ',' << sceneFootprint->points[i].y;
            points.push_back(stream.str());
        }
    }
    AddElements(AddElement("SceneFootprint", nullptr), "Pt", points);
}

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
