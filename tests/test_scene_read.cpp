// Reading scene description files: elements, text forms, the missing-tags error, and reading
// untrusted files safely.
#include <silvan/tosceneparser.h>

#include "support.h"

#include <limits>
#include <string>
#include <vector>

using kestrel::DataException;
using kestrel::FileAccessException;
using kestrel::FileNotFoundException;
using kestrel::processes::silvan::TOSceneParser;
using testsupport::ExpectThrownFrom;
using testsupport::TempDir;
using testsupport::WriteFile;

namespace {

const char* const kReadXMLFile =
    "virtual void kestrel::processes::silvan::TOSceneParser::ReadXMLFile()";

struct Elements {
    std::string source = "<SourceRaster>src.pix</SourceRaster>";
    std::string ortho = "<OrthoRaster>ortho.pix</OrthoRaster>";
    std::string visIdx = "<VisIdxmapRaster>vis.pix</VisIdxmapRaster>";
    std::string elevMap = "<ElevMapRaster>elev.pix</ElevMapRaster>";
    std::string optional;
    std::string footprint = "<SceneFootprint><Pt>1,2</Pt></SceneFootprint>";

    std::string Document(const std::string& doctype = "") const {
        return "<?xml version=\"1.0\" encoding=\"ISO-8859-1\"?>\n" + doctype +
               "<TOSceneDesc_Document>\n" + source + ortho + visIdx + elevMap + optional +
               footprint + "\n</TOSceneDesc_Document>\n";
    }
};

std::string Pts(const std::vector<std::string>& texts) {
    std::string out = "<SceneFootprint>";
    for (const std::string& text : texts)
        out += "<Pt>" + text + "</Pt>";
    return out + "</SceneFootprint>";
}

// Reads into a fresh default object, the way the parser factory does.
void ReadInto(TOSceneParser& scene, const std::string& path) {
    scene.SetXMLFilename(path);
    scene.Serialize(true);
}

void ExpectTagsMissing(const std::string& path) {
    try {
        TOSceneParser scene(path.c_str());
        FAIL() << "read without error";
    } catch (const FileAccessException& e) {
        EXPECT_EQ(e.GetErrorMessage(),
                  " Error in parsing " + path + " XML file. Some tags are missing.\n");
        EXPECT_EQ(e.GetFileName(), "");
        EXPECT_EQ(static_cast<int>(e.GetType()), 1);
        ExpectThrownFrom(e, kReadXMLFile, "tosceneparser.cpp");
    }
}

// The message of the FileAccessException that reading the file gives.
std::string ReadError(const std::string& path) {
    try {
        TOSceneParser scene(path.c_str());
    } catch (const FileAccessException& e) {
        EXPECT_EQ(e.GetFileName(), path);
        return e.GetErrorMessage();
    }
    ADD_FAILURE() << path << " was read without error";
    return "";
}

}  // namespace

TEST(SceneRead, MinimalFileLeavesOptionalDefaults) {
    TempDir dir;
    const std::string path = WriteFile(dir.File("s.xml"), Elements().Document());
    TOSceneParser scene(path.c_str());
    EXPECT_EQ(scene.GetXMLFilename(), path);
    EXPECT_EQ(scene.GetSceneFilename(), "src.pix");
    EXPECT_EQ(scene.GetOrthoFilename(), "ortho.pix");
    EXPECT_EQ(scene.GetVisIdxFilename(), "vis.pix");
    EXPECT_EQ(scene.GetElevMapFilename(), "elev.pix");
    EXPECT_EQ(scene.GetMmseg(), -1);
    EXPECT_EQ(scene.GetOrthoNoDataValue(), 0.0f);
    EXPECT_EQ(scene.GetElevNoDataValue(), -32768.0f);
    ASSERT_NE(scene.GetSceneFootprint(), nullptr);
    ASSERT_EQ(scene.GetSceneFootprint()->numPoints, 1u);
    EXPECT_EQ(scene.GetSceneFootprint()->points[0].x, 1.0);
    EXPECT_EQ(scene.GetSceneFootprint()->points[0].y, 2.0);
}

TEST(SceneRead, FreshObjectHoldsDefaults) {
    TOSceneParser scene;
    EXPECT_EQ(scene.GetXMLFilename(), "");
    EXPECT_EQ(scene.GetSceneFilename(), "");
    EXPECT_EQ(scene.GetMmseg(), -1);
    EXPECT_EQ(scene.GetOrthoNoDataValue(), 0.0f);
    EXPECT_EQ(scene.GetElevNoDataValue(), -32768.0f);
    EXPECT_EQ(scene.GetSceneFootprint(), nullptr);
}

TEST(SceneRead, ElementOrderDoesNotMatter) {
    TempDir dir;
    Elements e;
    e.optional = "<Mmseg>4</Mmseg><OrthoNoDataValue>-1.5</OrthoNoDataValue>";
    TOSceneParser inOrder(WriteFile(dir.File("a.xml"), e.Document()).c_str());

    const std::string shuffled = "<?xml version=\"1.0\"?><TOSceneDesc_Document>" + e.footprint +
                                 "<OrthoNoDataValue>-1.5</OrthoNoDataValue>" + e.elevMap +
                                 "<Mmseg>4</Mmseg>" + e.visIdx + e.ortho + e.source +
                                 "</TOSceneDesc_Document>";
    TOSceneParser reordered(WriteFile(dir.File("b.xml"), shuffled).c_str());
    EXPECT_EQ(reordered.GetSceneFilename(), inOrder.GetSceneFilename());
    EXPECT_EQ(reordered.GetOrthoFilename(), inOrder.GetOrthoFilename());
    EXPECT_EQ(reordered.GetVisIdxFilename(), inOrder.GetVisIdxFilename());
    EXPECT_EQ(reordered.GetElevMapFilename(), inOrder.GetElevMapFilename());
    EXPECT_EQ(reordered.GetMmseg(), 4);
    EXPECT_EQ(reordered.GetOrthoNoDataValue(), -1.5f);
    EXPECT_EQ(reordered.GetSceneFootprint()->numPoints, 1u);
}

TEST(SceneRead, EmptyAndUnparsableValues) {
    TempDir dir;
    Elements e;
    e.ortho = "<OrthoRaster/>";
    e.optional = "<Mmseg></Mmseg><OrthoNoDataValue>abc</OrthoNoDataValue><ElevNoDataValue/>";
    TOSceneParser scene;
    scene.SetMmseg(9);
    scene.SetOrthoNoDataValue(5.0f);
    scene.SetElevNoDataValue(7.0f);
    scene.SetOrthoFilename("kept?");
    ReadInto(scene, WriteFile(dir.File("s.xml"), e.Document()));
    EXPECT_EQ(scene.GetOrthoFilename(), "");       // empty text is a value
    EXPECT_EQ(scene.GetMmseg(), 9);                // empty: unchanged
    EXPECT_EQ(scene.GetOrthoNoDataValue(), 0.0f);  // letters: atof gives 0
    EXPECT_EQ(scene.GetElevNoDataValue(), 7.0f);   // empty: unchanged
}

TEST(SceneRead, NumbersAreReadAsTheCLibraryReadsThem) {
    TempDir dir;
    Elements e;
    e.optional =
        "<Mmseg> 12abc</Mmseg><OrthoNoDataValue>-9999</OrthoNoDataValue>"
        "<ElevNoDataValue>123456.7</ElevNoDataValue>";
    TOSceneParser scene(WriteFile(dir.File("s.xml"), e.Document()).c_str());
    EXPECT_EQ(scene.GetMmseg(), 12);
    EXPECT_EQ(scene.GetOrthoNoDataValue(), -9999.0f);
    EXPECT_EQ(scene.GetElevNoDataValue(), 123456.7f);

    e.optional =
        "<Mmseg>x</Mmseg><Mmseg>5</Mmseg><ElevNoDataValue>99999999999999</ElevNoDataValue>";
    e.optional += "<OrthoNoDataValue>1e40</OrthoNoDataValue>";
    TOSceneParser odd(WriteFile(dir.File("t.xml"), e.Document()).c_str());
    EXPECT_EQ(odd.GetMmseg(), 0);  // the first of several is read
    EXPECT_EQ(odd.GetElevNoDataValue(), 99999999999999.0f);
    EXPECT_EQ(odd.GetOrthoNoDataValue(), std::numeric_limits<float>::infinity());

    e.optional = "<Mmseg>99999999999999999999</Mmseg>";
    TOSceneParser huge(WriteFile(dir.File("u.xml"), e.Document()).c_str());
    EXPECT_EQ(huge.GetMmseg(), std::numeric_limits<int>::max());
}

TEST(SceneRead, PointTextsSplitAtTabCommaAndSemicolon) {
    TempDir dir;
    Elements e;
    e.footprint = Pts({"10.5,20.25", "11.5;20.25", "12.5\t20.25", " 13.5 , 20.25 ",
                       "\n   14.5,20.25\n  ", "15.5,20.25,99", "abc,16"});
    TOSceneParser scene(WriteFile(dir.File("s.xml"), e.Document()).c_str());
    const auto* footprint = scene.GetSceneFootprint();
    ASSERT_EQ(footprint->numPoints, 7u);
    for (unsigned int i = 0; i < 6; ++i) {
        EXPECT_EQ(footprint->points[i].x, 10.5 + i) << i;
        EXPECT_EQ(footprint->points[i].y, 20.25) << i;
    }
    EXPECT_EQ(footprint->points[6].x, 0.0);
    EXPECT_EQ(footprint->points[6].y, 16.0);
}

TEST(SceneRead, ConsecutiveDuplicatePointsAreDropped) {
    TempDir dir;
    Elements e;
    e.footprint = Pts({"1,1", "1,1", "2,2"});
    TOSceneParser scene(WriteFile(dir.File("s.xml"), e.Document()).c_str());
    const auto* footprint = scene.GetSceneFootprint();
    ASSERT_EQ(footprint->numPoints, 2u);
    EXPECT_EQ(footprint->points[1].x, 2.0);
    EXPECT_EQ(footprint->bbox.min.x, 1.0);
    EXPECT_EQ(footprint->bbox.min.y, 1.0);
    EXPECT_EQ(footprint->bbox.max.x, 2.0);
    EXPECT_EQ(footprint->bbox.max.y, 2.0);
}

TEST(SceneRead, EachMissingRequiredElementIsReported) {
    TempDir dir;
    for (int missing = 0; missing < 5; ++missing) {
        Elements e;
        std::string* parts[] = {&e.source, &e.ortho, &e.visIdx, &e.elevMap, &e.footprint};
        parts[missing]->clear();
        ExpectTagsMissing(
            WriteFile(dir.File("m" + std::to_string(missing) + ".xml"), e.Document()));
    }
}

TEST(SceneRead, MissingElementStopsTheReadersThatFollow) {
    TempDir dir;
    Elements e;
    e.ortho.clear();
    const std::string path = WriteFile(dir.File("s.xml"), e.Document());
    TOSceneParser scene;
    EXPECT_THROW(ReadInto(scene, path), FileAccessException);
    EXPECT_EQ(scene.GetSceneFilename(), "src.pix");  // read before the gap
    EXPECT_EQ(scene.GetVisIdxFilename(), "");        // not read
    EXPECT_EQ(scene.GetSceneFootprint(), nullptr);
}

TEST(SceneRead, FootprintWithoutPointsIsMissingButLeavesEmptyPolygon) {
    TempDir dir;
    Elements e;
    e.footprint = "<SceneFootprint></SceneFootprint>";
    const std::string path = WriteFile(dir.File("s.xml"), e.Document());
    ExpectTagsMissing(path);
    TOSceneParser scene;
    EXPECT_THROW(ReadInto(scene, path), FileAccessException);
    ASSERT_NE(scene.GetSceneFootprint(), nullptr);
    EXPECT_EQ(scene.GetSceneFootprint()->numPoints, 0u);
}

TEST(SceneRead, PointWithoutTwoCoordinatesIsRefused) {
    TempDir dir;
    for (const char* text : {"5", "", " ; ", "7,", "7, ,8"}) {
        Elements e;
        e.footprint = Pts({"1,2", text});
        const std::string path = WriteFile(dir.File("s.xml"), e.Document());
        try {
            TOSceneParser scene(path.c_str());
            FAIL() << "point \"" << text << "\" accepted";
        } catch (const DataException& err) {
            const std::string message = err.GetErrorMessage();
            EXPECT_NE(message.find(path), std::string::npos) << message;
            EXPECT_NE(message.find(std::string("\"") + text + "\""), std::string::npos) << message;
        }
    }
}

TEST(SceneRead, LongTextsAreReadWhole) {
    TempDir dir;
    Elements e;
    const std::string longName(300, 'n');
    e.source = "<SourceRaster>" + longName + "</SourceRaster>";
    TOSceneParser scene(WriteFile(dir.File("s.xml"), e.Document()).c_str());
    EXPECT_EQ(scene.GetSceneFilename(), longName);
}

TEST(SceneRead, EscapesEntitiesAndCharacterSetsGiveBytes) {
    TempDir dir;
    Elements e;
    e.source = "<SourceRaster>a&amp;b&lt;&#233;<![CDATA[<x>]]>&quot;</SourceRaster>";
    e.ortho = "<OrthoRaster>&e;</OrthoRaster>";
    const std::string doctype = "<!DOCTYPE TOSceneDesc_Document [<!ENTITY e \"inner\">]>\n";
    TOSceneParser latin(WriteFile(dir.File("l.xml"), e.Document(doctype)).c_str());
    EXPECT_EQ(latin.GetSceneFilename(), "a&b<\xE9<x>\"");
    EXPECT_EQ(latin.GetOrthoFilename(), "inner");

    // A UTF-8 document: characters up to U+00FF become their byte.
    e.ortho = "<OrthoRaster>caf\xC3\xA9</OrthoRaster>";
    std::string utf8 = e.Document();
    utf8.replace(utf8.find("ISO-8859-1"), 10, "UTF-8");
    TOSceneParser unicode(WriteFile(dir.File("u.xml"), utf8).c_str());
    EXPECT_EQ(unicode.GetOrthoFilename(), "caf\xE9");
}

TEST(SceneRead, CharacterWithoutSingleByteFormIsRefused) {
    TempDir dir;
    Elements e;
    e.elevMap = "<ElevMapRaster>&#x65E5;.pix</ElevMapRaster>";
    try {
        TOSceneParser scene(WriteFile(dir.File("s.xml"), e.Document()).c_str());
        FAIL();
    } catch (const DataException& err) {
        EXPECT_NE(err.GetErrorMessage().find("U+65E5"), std::string::npos);
        EXPECT_NE(err.GetErrorMessage().find("ElevMapRaster"), std::string::npos);
    }
}

TEST(SceneRead, ReadingAgainReplacesTheFootprint) {
    TempDir dir;
    Elements e;
    const std::string first = WriteFile(dir.File("a.xml"), e.Document());
    e.footprint = Pts({"5,5", "6,6", "7,7"});
    const std::string second = WriteFile(dir.File("b.xml"), e.Document());
    TOSceneParser scene(first.c_str());
    ReadInto(scene, second);
    EXPECT_EQ(scene.GetSceneFootprint()->numPoints, 3u);
}

TEST(SceneRead, MissingFileIsNotFound) {
    TempDir dir;
    const std::string path = dir.File("none.xml");
    try {
        TOSceneParser scene(path.c_str());
        FAIL();
    } catch (const FileNotFoundException& e) {
        EXPECT_EQ(e.GetFileName(), path);
        EXPECT_NE(e.GetErrorMessage().find(path), std::string::npos);
    }
    EXPECT_THROW(TOSceneParser(dir.Path().string().c_str()), FileAccessException);
}

TEST(SceneRead, MalformedXmlNamesFileAndPosition) {
    TempDir dir;
    const std::string whole = Elements().Document();
    const struct {
        const char* name;
        std::string bytes;
        const char* position;
    } cases[] = {
        {"empty.xml", "", "line 1"},
        {"cut.xml", whole.substr(0, whole.size() / 2), "line 3"},
        {"mismatch.xml", "<?xml version=\"1.0\"?>\n<TOSceneDesc_Document>\n<Pt>1,2</Mmseg>\n",
         "line 3"},
        {"text.xml", "not xml at all", "line 1"},
        {"twice.xml", whole + "<TOSceneDesc_Document/>", "line 5"},
    };
    for (const auto& c : cases) {
        const std::string path = WriteFile(dir.File(c.name), c.bytes);
        const std::string message = ReadError(path);
        EXPECT_NE(message.find(path), std::string::npos) << message;
        EXPECT_NE(message.find(c.position), std::string::npos) << message;
        EXPECT_NE(message.find("column"), std::string::npos) << message;
    }
}

TEST(SceneRead, ExternalEntitiesAreNeverFetched) {
    TempDir dir;
    const std::string secret = WriteFile(dir.File("secret.txt"), "TOPSECRET");
    Elements e;
    e.source = "<SourceRaster>&leak;</SourceRaster>";
    const std::string general =
        "<!DOCTYPE TOSceneDesc_Document [<!ENTITY leak SYSTEM \"" + secret + "\">]>\n";
    const std::string message = ReadError(WriteFile(dir.File("general.xml"), e.Document(general)));
    EXPECT_NE(message.find("external"), std::string::npos) << message;
    EXPECT_EQ(message.find("TOPSECRET"), std::string::npos) << message;

    e.source = "<SourceRaster>x</SourceRaster>";
    const std::string parameter =
        "<!DOCTYPE TOSceneDesc_Document [<!ENTITY % p SYSTEM \"" + secret + "\"> %p;]>\n";
    ReadError(WriteFile(dir.File("parameter.xml"), e.Document(parameter)));
}

TEST(SceneRead, ExternalDtdIsNeitherNeededNorFetched) {
    TempDir dir;
    // A DTD that would add an entity and make the file invalid is not read.
    WriteFile(dir.File("evil.dtd"), "<!ENTITY x SYSTEM \"/etc/passwd\"><!ELEMENT Nothing EMPTY>");
    Elements e;
    for (const char* system :
         {"evil.dtd", "TOSceneDesc_Document.dtd", "http://127.0.0.1:9/unreachable.dtd"}) {
        const std::string doctype =
            std::string("<!DOCTYPE TOSceneDesc_Document SYSTEM \"") + system + "\">\n";
        TOSceneParser scene(WriteFile(dir.File("s.xml"), e.Document(doctype)).c_str());
        EXPECT_EQ(scene.GetSceneFilename(), "src.pix") << system;
    }
}

TEST(SceneRead, EntityExpansionIsBounded) {
    TempDir dir;
    std::string laughs = "<!DOCTYPE TOSceneDesc_Document [<!ENTITY l0 \"lol\">";
    for (int i = 1; i <= 9; ++i) {
        laughs += "<!ENTITY l" + std::to_string(i) + " \"";
        for (int j = 0; j < 10; ++j)
            laughs += "&l" + std::to_string(i - 1) + ";";
        laughs += "\">";
    }
    laughs += "]>\n";
    Elements e;
    e.source = "<SourceRaster>&l9;</SourceRaster>";
    std::string message = ReadError(WriteFile(dir.File("laughs.xml"), e.Document(laughs)));
    EXPECT_NE(message.find("entity expansions"), std::string::npos) << message;

    // One large entity referenced many times, in text and in an attribute.
    const std::string big =
        "<!DOCTYPE TOSceneDesc_Document [<!ENTITY a \"" + std::string(200000, 'A') + "\">]>\n";
    std::string refs;
    for (int i = 0; i < 60; ++i)
        refs += "&a;";
    e.source = "<SourceRaster>" + refs + "</SourceRaster>";
    message = ReadError(WriteFile(dir.File("quadratic.xml"), e.Document(big)));
    EXPECT_NE(message.find("entity expansion"), std::string::npos) << message;
    e.source = "<SourceRaster a=\"" + refs + "\">x</SourceRaster>";
    ReadError(WriteFile(dir.File("attribute.xml"), e.Document(big)));

    // Escapes and character references are not entity expansions.
    std::string escaped;
    for (int i = 0; i < 5000; ++i)
        escaped += "&amp;&#65;";
    e.source = "<SourceRaster>" + escaped + "</SourceRaster>";
    TOSceneParser scene(WriteFile(dir.File("escaped.xml"), e.Document()).c_str());
    EXPECT_EQ(scene.GetSceneFilename().size(), 10000u);
}

namespace {

// Reaches the C-string lookup of the XML base.
class BufferReader : public kestrel::XMLParser {
  public:
    explicit BufferReader(const std::string& path) : XMLParser(path.c_str()) {}
    std::string text;

  private:
    std::string GetDocNameTag() const override { return "Doc"; }
    void AddElementsToDocument() override {}
    void ReadXMLFile() override {
        char buffer[kTagTextSize];
        if (ReadTagFromFile("Name", buffer))
            text = buffer;
        EXPECT_FALSE(ReadTagFromFile("Absent", buffer));
    }
};

}  // namespace

TEST(SceneRead, FixedBufferLookupRefusesTextsThatDoNotFit) {
    TempDir dir;
    const std::string fits(kestrel::XMLParser::kTagTextSize - 1, 'f');
    BufferReader reader(WriteFile(dir.File("a.xml"), "<Doc><Name>" + fits + "</Name></Doc>"));
    reader.Serialize(true);
    EXPECT_EQ(reader.text, fits);

    BufferReader tooLong(WriteFile(dir.File("b.xml"), "<Doc><Name>" + fits + "x</Name></Doc>"));
    EXPECT_THROW(tooLong.Serialize(true), DataException);
}
