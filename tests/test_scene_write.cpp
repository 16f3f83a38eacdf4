// Writing scene description files: the exact layout, round trips, the footprint copy, the DTD
// beside the file, and acceptance by an independent validator.
#include <silvan/tosceneparser.h>

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
using testsupport::Contains;
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

// Writes the scene to path and returns the text written.
std::string Write(TOSceneParser& scene, const std::string& path) {
    scene.SetXMLFilename(path);
    scene.Serialize(false);
    return ReadFile(path);
}

// A scene with every file name and a footprint.
void Fill(TOSceneParser& scene) {
    scene.SetSceneFilename("src.tif");
    scene.SetOrthoFilename("ortho.tif");
    scene.SetVisIdxFilename("vis.tif");
    scene.SetElevMapFilename("elev.tif");
    const Polygon<double> polygon = MakePolygon({{500000.25, 4100000.5}, {-1, 2.5}});
    scene.SetSceneFootprint(&polygon);
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

class SceneWrite : public ::testing::Test {
  protected:
    TempDir dir;
};

}  // namespace

// The whole document: declaration, document type, the elements in their order, one a line;
// no-data values with 6 significant digits.
TEST_F(SceneWrite, DocumentLayoutAndTextForms) {
    TOSceneParser scene;
    Fill(scene);
    scene.SetMmseg(1);
    scene.SetOrthoNoDataValue(123456.7f);
    scene.SetElevNoDataValue(-9999.5f);
    EXPECT_EQ(Write(scene, dir.File("s.xml")),
              "<?xml version=\"1.0\" encoding=\"ISO-8859-1\" standalone=\"no\" ?>\n"
              "<!DOCTYPE TOSceneDesc_Document SYSTEM \"TOSceneDesc_Document.dtd\">\n"
              "<TOSceneDesc_Document>\n"
              "  <SourceRaster>src.tif</SourceRaster>\n"
              "  <OrthoRaster>ortho.tif</OrthoRaster>\n"
              "  <VisIdxmapRaster>vis.tif</VisIdxmapRaster>\n"
              "  <ElevMapRaster>elev.tif</ElevMapRaster>\n"
              "  <Mmseg>1</Mmseg>\n"
              "  <OrthoNoDataValue>123457</OrthoNoDataValue>\n"
              "  <ElevNoDataValue>-9999.5</ElevNoDataValue>\n"
              "  <SceneFootprint>\n"
              "    <Pt>500000.25,4100000.5</Pt>\n"
              "    <Pt>-1,2.5</Pt>\n"
              "  </SceneFootprint>\n"
              "</TOSceneDesc_Document>\n");
}

TEST_F(SceneWrite, RoundTripKeepsOddNamesAndVerticesExactlyAndMmsegOnlyAboveZero) {
    // A directory and file name with markup characters and non-ASCII bytes.
    const std::string sub = dir.File("d\xE9 & <x> \"q\" 'a'");
    std::filesystem::create_directory(sub);
    const std::string path = sub + "/sc\xE8ne & <1>.xml";
    std::string allBytes;
    for (int byte = 0x20; byte <= 0xFF; ++byte)
        allBytes += static_cast<char>(byte);
    const std::vector<std::string> names = {
        "a & b < c > \"d\" 'e'.tif", allBytes, "  blanks around  ", "tab\tline\nreturn\r\ncr\rend",
        "]]> <![CDATA[ &amp; &#65;", ""};
    const double big = std::numeric_limits<double>::max();
    const std::vector<P> points = {{0.1, -0.30000000000000004},
                                   {1.0 / 3.0, 2.0 / 3.0},
                                   {big, std::numeric_limits<double>::denorm_min()},
                                   {-0.0, 1e-300},
                                   {-123456789.123456789, 987654321.987654321}};
    const int mmsegs[] = {7, 1, 0, -5, -1, 2};
    for (std::size_t i = 0; i < names.size(); ++i) {
        TOSceneParser scene;
        scene.SetSceneFilename(names[i]);
        scene.SetOrthoFilename(names[(i + 1) % names.size()]);
        scene.SetVisIdxFilename(names[(i + 2) % names.size()]);
        scene.SetElevMapFilename(names[(i + 3) % names.size()]);
        scene.SetMmseg(mmsegs[i]);
        scene.SetOrthoNoDataValue(-1.25f);
        scene.SetElevNoDataValue(3.14159265f);
        const Polygon<double> polygon = MakePolygon(points);
        scene.SetSceneFootprint(&polygon);
        EXPECT_EQ(Contains(Write(scene, path), "Mmseg"), mmsegs[i] > 0) << i;

        TOSceneParser back(path.c_str());
        EXPECT_EQ(back.GetSceneFilename(), scene.GetSceneFilename()) << i;
        EXPECT_EQ(back.GetOrthoFilename(), scene.GetOrthoFilename()) << i;
        EXPECT_EQ(back.GetVisIdxFilename(), scene.GetVisIdxFilename()) << i;
        EXPECT_EQ(back.GetElevMapFilename(), scene.GetElevMapFilename()) << i;
        EXPECT_EQ(back.GetMmseg(), mmsegs[i] > 0 ? mmsegs[i] : -1);
        EXPECT_EQ(back.GetOrthoNoDataValue(), -1.25f);
        EXPECT_EQ(back.GetElevNoDataValue(), 3.14159f);  // 6 significant digits
        const Polygon<double>* footprint = back.GetSceneFootprint();
        ASSERT_EQ(footprint->numPoints, points.size());
        EXPECT_EQ(std::memcmp(footprint->points, points.data(), points.size() * sizeof(P)), 0);
    }
    EXPECT_EQ(ReadFile(sub + "/TOSceneDesc_Document.dtd"), kDtd);
}

TEST_F(SceneWrite, ControlBytesAndNulAreRefusedNotCorrupted) {
    for (const std::string& name : {std::string("a\x01z"), std::string("a\0b", 3)}) {
        TOSceneParser scene;
        Fill(scene);
        scene.SetVisIdxFilename(name);
        const auto e = testsupport::Thrown<DataException>([&] { Write(scene, dir.File("s.xml")); });
        EXPECT_TRUE(e && Contains(e->GetErrorMessage(), "VisIdxmapRaster"));
    }
}

TEST_F(SceneWrite, FootprintIsACopyReleasedByInitAndWrittenEmptyWhenAbsent) {
    TOSceneParser scene;
    const std::string path = dir.File("s.xml");
    const std::string text = Write(scene, path);
    EXPECT_TRUE(Contains(text, "<SceneFootprint/>")) << text;
    EXPECT_FALSE(Contains(text, "<Pt")) << text;
    EXPECT_THROW(TOSceneParser(path.c_str()), FileAccessException);  // no point to read back

    Polygon<double> mine = MakePolygon({{1, 1}, {2, 2}});
    scene.SetSceneFootprint(&mine);
    mine.points[0].x = 99;
    EXPECT_EQ(scene.GetSceneFootprint()->points[0].x, 1.0);
    // Given its own polygon, the object keeps an equal one.
    scene.SetSceneFootprint(scene.GetSceneFootprint());
    ASSERT_EQ(scene.GetSceneFootprint()->numPoints, 2u);
    EXPECT_EQ(scene.GetSceneFootprint()->points[1].y, 2.0);
    EXPECT_THROW(scene.SetSceneFootprint(nullptr), DataException);
    EXPECT_EQ(scene.GetSceneFootprint()->numPoints, 2u);

    scene.Init();  // releases the footprint (the leak checker watches)
    EXPECT_EQ(scene.GetSceneFootprint(), nullptr);
}

TEST_F(SceneWrite, DtdIsWrittenExactlyBesideTheXmlFileUnlessPresent) {
    TempDir elsewhere;
    CurrentDirectory inside(elsewhere.Path());
    TOSceneParser scene;
    Fill(scene);
    EXPECT_THROW(scene.Serialize(false), FileAccessException);  // no file name: nothing written
    EXPECT_TRUE(std::filesystem::is_empty(elsewhere.Path()));

    std::filesystem::create_directory(dir.Path() / "out");
    Write(scene, dir.File("out/s.xml"));
    EXPECT_EQ(ReadFile(dir.File("out/TOSceneDesc_Document.dtd")), kDtd);
    EXPECT_FALSE(std::filesystem::exists(elsewhere.Path() / "TOSceneDesc_Document.dtd"));

    Write(scene, "rel.xml");  // a relative name is taken from the current directory
    EXPECT_EQ(ReadFile((elsewhere.Path() / "TOSceneDesc_Document.dtd").string()), kDtd);

    const std::string dtd = WriteFile(dir.File("TOSceneDesc_Document.dtd"), "mine\n");
    Write(scene, dir.File("s.xml"));
    EXPECT_EQ(ReadFile(dtd), "mine\n");
}

// A scene that cannot be written leaves no DTD behind, and the previous file as it was; a DTD
// that cannot be created is reported.
TEST_F(SceneWrite, FailedWritingLeavesNoDtdAndAnUncreatableDtdIsReported) {
    TOSceneParser scene;
    Fill(scene);
    std::filesystem::create_directory(dir.File("s.xml"));  // the XML file cannot be made
    EXPECT_THROW(Write(scene, dir.File("s.xml")), FileAccessException);
    EXPECT_FALSE(std::filesystem::exists(dir.File("TOSceneDesc_Document.dtd")));
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.Path()), {}), 1);

    const std::string directory = dir.File("missing") + "/";
    const std::string dtd = directory + "TOSceneDesc_Document.dtd";
    if (const auto e =
            testsupport::Thrown<FileAccessException>([&] { Write(scene, directory + "s.xml"); })) {
        EXPECT_EQ(e->GetFileName(), dtd);
        EXPECT_EQ(static_cast<int>(e->GetType()), 5);
        const std::string head = " Scene XML file: " + dtd + " couldn't be created because\n ";
        const std::string message = e->GetErrorMessage();
        EXPECT_EQ(message.substr(0, head.size()), head) << message;
        EXPECT_TRUE(Contains(message, "cannot be created: No such file")) << message;
        EXPECT_EQ(message.back(), '\n');
        testsupport::ExpectThrownFrom(
            *e,
            "void kestrel::processes::silvan::TOSceneParser::CreateDTDFile(const std::string&) "
            "const",
            "tosceneparser.cpp");
    }
}

TEST_F(SceneWrite, WrittenFileAndDtdAreValid) {
    if (std::system("xmllint --version > /dev/null 2>&1") != 0)
        GTEST_SKIP() << "xmllint is not installed";
    const auto valid = [](const std::string& path) {
        return std::system(("xmllint --valid --noout '" + path + "' > /dev/null 2>&1").c_str()) ==
               0;
    };
    TOSceneParser scene;
    Fill(scene);
    scene.SetMmseg(2);
    scene.SetSceneFilename("odd & <name> \"q\" \xE9\xFF\r\n");
    // (xmllint does not find a DTD beside a file whose path holds a blank.)
    Write(scene, dir.File("valid_scene.xml"));
    EXPECT_TRUE(valid(dir.File("valid_scene.xml")));
    TOSceneParser empty;
    Write(empty, dir.File("empty.xml"));
    EXPECT_TRUE(valid(dir.File("empty.xml")));

    // The validator does notice a file that breaks the DTD.
    WriteFile(dir.File("bad.xml"),
              "<?xml version=\"1.0\"?>\n<!DOCTYPE TOSceneDesc_Document SYSTEM "
              "\"TOSceneDesc_Document.dtd\">\n<TOSceneDesc_Document><Other/>"
              "</TOSceneDesc_Document>\n");
    EXPECT_FALSE(valid(dir.File("bad.xml")));
}
