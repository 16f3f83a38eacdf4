// Writing scene description files: text forms, round trips, the DTD beside the file, and
// acceptance by an independent validator.
#include <kestrel/xmlparser.h>
#include <silvan/tosceneparser.h>
#include <xercesc/dom/DOM.hpp>

#include "support.h"

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <limits>
#include <string>
#include <vector>

using kestrel::DataException;
using kestrel::FileAccessException;
using kestrel::processes::silvan::TOSceneParser;
using kestrel::tin::Polygon;
using testsupport::ExpectThrownFrom;
using testsupport::ReadFile;
using testsupport::TempDir;
using testsupport::WriteFile;
using P = point2_t<double>;

namespace {

const char kDtd[] =
    "<?xml version=\"1.0\" encoding=\"ISO-8859-1\"?>\n\n"
    "<!-- True Ortho Scene Description File -->\n"
    "<!ELEMENT TOSceneDesc_Document (SourceRaster | OrthoRaster | VisIdxmapRaster | "
    "ElevMapRaster | Mmseg | OrthoNoDataValue | ElevNoDataValue | SceneFootprint)*>\n"
    "<!ELEMENT SourceRaster (#PCDATA)>\n"
    "<!ELEMENT OrthoRaster (#PCDATA)>\n"
    "<!ELEMENT VisIdxmapRaster (#PCDATA)>\n"
    "<!ELEMENT ElevMapRaster (#PCDATA)>\n"
    "<!ELEMENT Mmseg (#PCDATA)>\n"
    "<!ELEMENT OrthoNoDataValue (#PCDATA)>\n"
    "<!ELEMENT ElevNoDataValue (#PCDATA)>\n"
    "<!ELEMENT SceneFootprint ((Pt*))>\n"
    "<!ELEMENT Pt (#PCDATA)>\n";

Polygon<double> MakePolygon(const std::vector<P>& points) {
    P* array = new P[points.size()];
    std::copy(points.begin(), points.end(), array);
    return Polygon<double>(array, static_cast<unsigned int>(points.size()));
}

void Write(TOSceneParser& scene, const std::string& path) {
    scene.SetXMLFilename(path);
    scene.Serialize(false);
}

// A scene with every member set and a footprint.
void Fill(TOSceneParser& scene) {
    scene.SetSceneFilename("src.pix");
    scene.SetOrthoFilename("ortho.pix");
    scene.SetVisIdxFilename("vis.pix");
    scene.SetElevMapFilename("elev.pix");
    const Polygon<double> polygon = MakePolygon({{500000.25, 4100000.5}, {-1, 2.5}});
    scene.SetSceneFootprint(&polygon);
}

std::string WrittenText(TOSceneParser& scene, const std::string& path) {
    Write(scene, path);
    return ReadFile(path);
}

bool Contains(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

// Runs a shell command; the test is skipped when xmllint is not installed.
int RunXmllint(const std::string& arguments) {
    if (std::system("xmllint --version > /dev/null 2>&1") != 0)
        return -1;
    return std::system(("xmllint " + arguments + " > /dev/null 2>&1").c_str());
}

std::string Quoted(const std::string& path) {
    std::string out = "'";
    for (char c : path)
        out += c == '\'' ? std::string("'\\''") : std::string(1, c);
    return out + "'";
}

// Makes a directory the current one for the life of the object.
class CurrentDirectory {
  public:
    explicit CurrentDirectory(const std::filesystem::path& path)
        : saved_(std::filesystem::current_path()) {
        std::filesystem::current_path(path);
    }
    ~CurrentDirectory() { std::filesystem::current_path(saved_); }

  private:
    std::filesystem::path saved_;
};

}  // namespace

TEST(SceneWrite, TextFormsOfTheMembers) {
    TempDir dir;
    TOSceneParser scene;
    Fill(scene);
    scene.SetMmseg(3);
    scene.SetElevNoDataValue(-32768.0f);
    scene.SetOrthoNoDataValue(0.0f);
    std::string text = WrittenText(scene, dir.File("s.xml"));
    EXPECT_TRUE(Contains(text, "<Mmseg>3</Mmseg>")) << text;
    EXPECT_TRUE(Contains(text, "<OrthoNoDataValue>0</OrthoNoDataValue>")) << text;
    EXPECT_TRUE(Contains(text, "<ElevNoDataValue>-32768</ElevNoDataValue>")) << text;
    EXPECT_TRUE(Contains(text, "<Pt>500000.25,4100000.5</Pt>")) << text;
    EXPECT_TRUE(Contains(text, "<Pt>-1,2.5</Pt>")) << text;
    EXPECT_TRUE(
        Contains(text, "<!DOCTYPE TOSceneDesc_Document SYSTEM \"TOSceneDesc_Document.dtd\">"))
        << text;

    scene.SetOrthoNoDataValue(123456.7f);
    scene.SetElevNoDataValue(-9999.5f);
    text = WrittenText(scene, dir.File("s.xml"));
    EXPECT_TRUE(Contains(text, "<OrthoNoDataValue>123457</OrthoNoDataValue>")) << text;
    EXPECT_TRUE(Contains(text, "<ElevNoDataValue>-9999.5</ElevNoDataValue>")) << text;
}

// The whole document: declaration, document type, the elements in their order, one a line.
TEST(SceneWrite, DocumentLayout) {
    TempDir dir;
    TOSceneParser scene;
    Fill(scene);
    scene.SetMmseg(1);
    EXPECT_EQ(WrittenText(scene, dir.File("s.xml")),
              "<?xml version=\"1.0\" encoding=\"ISO-8859-1\" standalone=\"no\" ?>\n"
              "<!DOCTYPE TOSceneDesc_Document SYSTEM \"TOSceneDesc_Document.dtd\">\n"
              "<TOSceneDesc_Document>\n"
              "  <SourceRaster>src.pix</SourceRaster>\n"
              "  <OrthoRaster>ortho.pix</OrthoRaster>\n"
              "  <VisIdxmapRaster>vis.pix</VisIdxmapRaster>\n"
              "  <ElevMapRaster>elev.pix</ElevMapRaster>\n"
              "  <Mmseg>1</Mmseg>\n"
              "  <OrthoNoDataValue>0</OrthoNoDataValue>\n"
              "  <ElevNoDataValue>-32768</ElevNoDataValue>\n"
              "  <SceneFootprint>\n"
              "    <Pt>500000.25,4100000.5</Pt>\n"
              "    <Pt>-1,2.5</Pt>\n"
              "  </SceneFootprint>\n"
              "</TOSceneDesc_Document>\n");
}

TEST(SceneWrite, MmsegIsWrittenOnlyAboveZero) {
    TempDir dir;
    for (int mmseg : {-1, 0, -5}) {
        TOSceneParser scene;
        Fill(scene);
        scene.SetMmseg(mmseg);
        const std::string path = dir.File("s.xml");
        EXPECT_FALSE(Contains(WrittenText(scene, path), "Mmseg")) << mmseg;
        TOSceneParser back(path.c_str());
        EXPECT_EQ(back.GetMmseg(), -1);
    }
}

TEST(SceneWrite, RoundTripKeepsNamesNumbersAndVerticesExactly) {
    TempDir dir;
    std::string allBytes;
    for (int byte = 0x20; byte <= 0xFF; ++byte)
        allBytes += static_cast<char>(byte);
    const std::vector<std::string> names = {
        "a & b < c > \"d\" 'e'.pix",
        allBytes,
        "  blanks around  ",
        "tab\tline\nreturn\r\ncr\rend",
        std::string(300, 'L') + "\xE9\xFF",
        "]]> <![CDATA[ &amp; &#65;",
        "",
    };
    const double tiny = std::numeric_limits<double>::denorm_min();
    const std::vector<P> points = {
        {500000.25, 4100000.5}, {0.1, -0.30000000000000004},
        {1.0 / 3.0, 2.0 / 3.0}, {std::numeric_limits<double>::max(), tiny},
        {-0.0, 1e-300},         {-123456789.123456789, 987654321.987654321}};
    for (std::size_t i = 0; i < names.size(); ++i) {
        TOSceneParser scene;
        scene.SetSceneFilename(names[i]);
        scene.SetOrthoFilename(names[(i + 1) % names.size()]);
        scene.SetVisIdxFilename(names[(i + 2) % names.size()]);
        scene.SetElevMapFilename(names[(i + 3) % names.size()]);
        scene.SetMmseg(7);
        scene.SetOrthoNoDataValue(-1.25f);
        scene.SetElevNoDataValue(3.14159265f);
        const Polygon<double> polygon = MakePolygon(points);
        scene.SetSceneFootprint(&polygon);
        const std::string path = dir.File("s.xml");
        Write(scene, path);

        TOSceneParser back(path.c_str());
        EXPECT_EQ(back.GetSceneFilename(), scene.GetSceneFilename()) << i;
        EXPECT_EQ(back.GetOrthoFilename(), scene.GetOrthoFilename()) << i;
        EXPECT_EQ(back.GetVisIdxFilename(), scene.GetVisIdxFilename()) << i;
        EXPECT_EQ(back.GetElevMapFilename(), scene.GetElevMapFilename()) << i;
        EXPECT_EQ(back.GetMmseg(), 7);
        EXPECT_EQ(back.GetOrthoNoDataValue(), -1.25f);
        EXPECT_EQ(back.GetElevNoDataValue(), 3.14159f);  // 6 significant digits
        const Polygon<double>* footprint = back.GetSceneFootprint();
        ASSERT_EQ(footprint->numPoints, points.size());
        for (std::size_t k = 0; k < points.size(); ++k) {
            EXPECT_EQ(std::memcmp(&footprint->points[k], &points[k], sizeof(P)), 0)
                << "vertex " << k;
        }
    }
}

TEST(SceneWrite, ScenesInAnyDirectoryAndWithOddFileNamesRoundTrip) {
    TempDir dir;
    const std::string sub = dir.File("d\xE9 & <x> \"q\" 'a'");
    std::filesystem::create_directory(sub);
    const std::string path = sub + "/sc\xE8ne & <1>.xml";
    TOSceneParser scene;
    Fill(scene);
    Write(scene, path);
    TOSceneParser back(path.c_str());
    EXPECT_EQ(back.GetSceneFilename(), "src.pix");
    EXPECT_EQ(ReadFile(sub + "/TOSceneDesc_Document.dtd"), kDtd);
}

TEST(SceneWrite, ControlBytesAndNulAreRefusedNotCorrupted) {
    TempDir dir;
    for (const std::string& name : {std::string("a\x01"
                                                "b"),
                                    std::string("a\0b", 3)}) {
        TOSceneParser scene;
        Fill(scene);
        scene.SetVisIdxFilename(name);
        try {
            Write(scene, dir.File("s.xml"));
            FAIL() << "written";
        } catch (const DataException& e) {
            EXPECT_TRUE(Contains(e.GetErrorMessage(), "VisIdxmapRaster")) << e.GetErrorMessage();
        }
    }
}

TEST(SceneWrite, SceneWithoutFootprintGetsEmptyElement) {
    TempDir dir;
    TOSceneParser scene;
    const std::string path = dir.File("s.xml");
    const std::string text = WrittenText(scene, path);
    EXPECT_TRUE(Contains(text, "<SceneFootprint/>")) << text;
    EXPECT_FALSE(Contains(text, "<Pt")) << text;
    EXPECT_TRUE(Contains(text, "<SourceRaster></SourceRaster>") ||
                Contains(text, "<SourceRaster/>"))
        << text;
    // Such a file has no point, so it cannot be read back.
    EXPECT_THROW(TOSceneParser(path.c_str()), FileAccessException);
}

TEST(SceneWrite, FootprintIsACopy) {
    TOSceneParser scene;
    EXPECT_EQ(scene.GetSceneFootprint(), nullptr);
    Polygon<double> mine = MakePolygon({{1, 1}, {2, 2}});
    scene.SetSceneFootprint(&mine);
    mine.points[0].x = 99;
    EXPECT_EQ(scene.GetSceneFootprint()->points[0].x, 1.0);
    EXPECT_NE(scene.GetSceneFootprint()->points, mine.points);

    // Given its own polygon, the object keeps an equal one.
    scene.SetSceneFootprint(scene.GetSceneFootprint());
    ASSERT_EQ(scene.GetSceneFootprint()->numPoints, 2u);
    EXPECT_EQ(scene.GetSceneFootprint()->points[1].y, 2.0);

    EXPECT_THROW(scene.SetSceneFootprint(nullptr), DataException);
    EXPECT_EQ(scene.GetSceneFootprint()->numPoints, 2u);

    scene.SetMmseg(4);
    scene.Init();  // releases the footprint (the leak checker watches)
    EXPECT_EQ(scene.GetSceneFootprint(), nullptr);
    EXPECT_EQ(scene.GetMmseg(), -1);
}

TEST(SceneWrite, DtdIsWrittenBesideTheXmlFileExactly) {
    TempDir dir;
    TempDir elsewhere;
    CurrentDirectory inside(elsewhere.Path());
    std::filesystem::create_directory(dir.Path() / "out");
    const std::string path = dir.File("out/s.xml");
    TOSceneParser scene;
    Fill(scene);
    Write(scene, path);
    EXPECT_EQ(ReadFile(dir.File("out/TOSceneDesc_Document.dtd")), kDtd);
    EXPECT_FALSE(std::filesystem::exists(elsewhere.Path() / "TOSceneDesc_Document.dtd"));

    // A relative name is taken from the current directory.
    Write(scene, "rel.xml");
    EXPECT_EQ(ReadFile((elsewhere.Path() / "TOSceneDesc_Document.dtd").string()), kDtd);
}

TEST(SceneWrite, ExistingDtdIsNotRewritten) {
    TempDir dir;
    const std::string dtd = WriteFile(dir.File("TOSceneDesc_Document.dtd"), "mine\n");
    TOSceneParser scene;
    Fill(scene);
    Write(scene, dir.File("s.xml"));
    EXPECT_EQ(ReadFile(dtd), "mine\n");
}

TEST(SceneWrite, DtdThatCannotBeCreatedIsReported) {
    TempDir dir;
    const std::string directory = dir.File("missing") + "/";
    const std::string dtd = directory + "TOSceneDesc_Document.dtd";
    TOSceneParser scene;
    Fill(scene);
    try {
        Write(scene, directory + "s.xml");
        FAIL();
    } catch (const FileAccessException& e) {
        EXPECT_EQ(e.GetFileName(), dtd);
        EXPECT_EQ(static_cast<int>(e.GetType()), 5);
        const std::string head = " Scene XML file: " + dtd + " couldn't be created because\n ";
        const std::string message = e.GetErrorMessage();
        EXPECT_EQ(message.substr(0, head.size()), head) << message;
        EXPECT_TRUE(Contains(message, "Cannot open file")) << message;  // the opening error
        EXPECT_EQ(message.back(), '\n');
        ExpectThrownFrom(e,
                         "void kestrel::processes::silvan::TOSceneParser::CreateDTDFile(const "
                         "std::string&) const",
                         "tosceneparser.cpp");
    }
}

TEST(SceneWrite, WritingWithoutFileNameWritesNothing) {
    TempDir elsewhere;
    CurrentDirectory inside(elsewhere.Path());
    TOSceneParser scene;
    Fill(scene);
    EXPECT_THROW(scene.Serialize(false), FileAccessException);
    EXPECT_TRUE(std::filesystem::is_empty(elsewhere.Path()));
}

TEST(SceneWrite, WrittenFileAndDtdAreValid) {
    TempDir dir;
    TOSceneParser scene;
    Fill(scene);
    scene.SetMmseg(2);
    scene.SetSceneFilename("odd & <name> \"q\" \xE9\xFF\r\n");
    // (xmllint does not find a DTD beside a file whose path holds a blank.)
    const std::string path = dir.File("valid_scene.xml");
    Write(scene, path);
    TOSceneParser empty;
    const std::string emptyPath = dir.File("empty.xml");
    Write(empty, emptyPath);

    const int rc = RunXmllint("--valid --noout " + Quoted(path) + " " + Quoted(emptyPath));
    if (rc == -1)
        GTEST_SKIP() << "xmllint is not installed";
    EXPECT_EQ(rc, 0);

    // The validator does notice a file that breaks the DTD.
    WriteFile(dir.File("bad.xml"),
              "<?xml version=\"1.0\"?>\n<!DOCTYPE TOSceneDesc_Document SYSTEM "
              "\"TOSceneDesc_Document.dtd\">\n<TOSceneDesc_Document><Other/>"
              "</TOSceneDesc_Document>\n");
    EXPECT_NE(RunXmllint("--valid --noout " + Quoted(dir.File("bad.xml"))), 0);
}

namespace {

// A document of the XML base without a document type, or with one from the helper.
class PlainWriter : public kestrel::XMLParser {
  public:
    PlainWriter(const std::string& path, bool withType) : withType_(withType) {
        SetXMLFilename(path);
    }

  private:
    XERCES_CPP_NAMESPACE::DOMDocumentType* GetDOMDocumenType() const override {
        return withType_ ? kestrel::KESTREL_XMLUtil::CreateDocumentType("Doc", "-//P//X", "d.dtd")
                         : nullptr;
    }
    std::string GetDocNameTag() const override { return "Doc"; }
    void ReadXMLFile() override {}
    void AddElementsToDocument() override { AddElement("A", "1"); }
    bool withType_;
};

}  // namespace

TEST(SceneWrite, XmlBaseWritesDocumentTypeOnlyWhenGiven) {
    TempDir dir;
    PlainWriter plain(dir.File("plain.xml"), false);
    plain.Serialize(false);
    const std::string text = ReadFile(dir.File("plain.xml"));
    EXPECT_FALSE(Contains(text, "DOCTYPE")) << text;
    EXPECT_TRUE(Contains(text, "<A>1</A>")) << text;

    PlainWriter typed(dir.File("typed.xml"), true);
    typed.Serialize(false);
    EXPECT_TRUE(
        Contains(ReadFile(dir.File("typed.xml")), "<!DOCTYPE Doc PUBLIC \"-//P//X\" \"d.dtd\">"))
        << ReadFile(dir.File("typed.xml"));
}

TEST(SceneWrite, DocumentTypeComesWithItsOwnDocument) {
    XERCES_CPP_NAMESPACE::DOMDocumentType* type =
        kestrel::KESTREL_XMLUtil::CreateDocumentType("Doc", "", "d.dtd");
    ASSERT_NE(type, nullptr);
    ASSERT_NE(type->getOwnerDocument(), nullptr);
    type->getOwnerDocument()->release();  // the leak checker watches
}
