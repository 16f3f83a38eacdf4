// Reading scene description files: elements, text forms, the missing-tags error, and reading
// untrusted files safely.
#include <silvan/tosceneparser.h>

#include "support.h"

#include <cstring>
#include <limits>
#include <string>
#include <thread>
#include <type_traits>
#include <vector>

#if defined(__linux__)
#include <sys/stat.h>
#endif

using kestrel::DataException;
using kestrel::FileAccessException;
using kestrel::processes::silvan::TOSceneParser;
using testsupport::Contains;
using testsupport::TempDir;
using testsupport::WriteFile;

namespace {

struct Elements {
    std::string source = "<SourceRaster>src.tif</SourceRaster>";
    std::string ortho = "<OrthoRaster>ortho.tif</OrthoRaster>";
    std::string visIdx = "<VisIdxmapRaster>vis.tif</VisIdxmapRaster>";
    std::string elevMap = "<ElevMapRaster>elev.tif</ElevMapRaster>";
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

// Reads into an existing object, the way the parser factory does.
void ReadInto(TOSceneParser& scene, const std::string& path) {
    scene.SetXMLFilename(path);
    scene.Serialize(true);
}

// The message of the exception that reading the file gives; a file error names the file.
template <class E = FileAccessException>
std::string ReadError(const std::string& path) {
    try {
        TOSceneParser scene(path.c_str());
    } catch (const E& e) {
        if constexpr (std::is_base_of_v<kestrel::FileException, E>) {
            EXPECT_EQ(e.GetFileName(), path);
        }
        return e.GetErrorMessage();
    }
    ADD_FAILURE() << path << " was read without error";
    return "";
}

class SceneRead : public ::testing::Test {
  protected:
    std::string Put(const std::string& name, const std::string& bytes) {
        return WriteFile(dir.File(name), bytes);
    }
    TempDir dir;
};

}  // namespace

TEST_F(SceneRead, ElementsInAnyOrderAndDefaultsForAbsentOptionalOnes) {
    const std::string path = Put("s.xml", Elements().Document());
    TOSceneParser minimal(path.c_str());
    EXPECT_EQ(minimal.GetMmseg(), -1);
    EXPECT_EQ(minimal.GetOrthoNoDataValue(), 0.0f);
    EXPECT_EQ(minimal.GetElevNoDataValue(), -32768.0f);

    Elements e;
    const std::string shuffled = "<?xml version=\"1.0\"?><TOSceneDesc_Document>" + e.footprint +
                                 "<OrthoNoDataValue>-1.5</OrthoNoDataValue>" + e.elevMap +
                                 "<Mmseg>4</Mmseg>" + e.visIdx + e.ortho + e.source +
                                 "</TOSceneDesc_Document>";
    TOSceneParser scene(Put("b.xml", shuffled).c_str());
    EXPECT_EQ(scene.GetSceneFilename(), "src.tif");
    EXPECT_EQ(scene.GetOrthoFilename(), "ortho.tif");
    EXPECT_EQ(scene.GetVisIdxFilename(), "vis.tif");
    EXPECT_EQ(scene.GetElevMapFilename(), "elev.tif");
    EXPECT_EQ(scene.GetMmseg(), 4);
    EXPECT_EQ(scene.GetOrthoNoDataValue(), -1.5f);
    ASSERT_EQ(scene.GetSceneFootprint()->numPoints, 1u);
    EXPECT_EQ(scene.GetSceneFootprint()->points[0].y, 2.0);

    // Reading again replaces the footprint (the leak checker watches the old one).
    e.footprint = Pts({"5,5", "6,6", "7,7"});
    ReadInto(scene, Put("c.xml", e.Document()));
    EXPECT_EQ(scene.GetSceneFootprint()->numPoints, 3u);
}

TEST_F(SceneRead, NumbersAreReadAsTheCLibraryReadsThemAndEmptyOnesChangeNothing) {
    Elements e;
    e.ortho = "<OrthoRaster/>";
    e.optional = "<Mmseg></Mmseg><OrthoNoDataValue>abc</OrthoNoDataValue><ElevNoDataValue/>";
    TOSceneParser scene;
    scene.SetMmseg(9);
    scene.SetElevNoDataValue(7.0f);
    scene.SetOrthoFilename("kept?");
    ReadInto(scene, Put("s.xml", e.Document()));
    EXPECT_EQ(scene.GetOrthoFilename(), "");       // empty text is a value
    EXPECT_EQ(scene.GetMmseg(), 9);                // empty: unchanged
    EXPECT_EQ(scene.GetOrthoNoDataValue(), 0.0f);  // letters: atof gives 0
    EXPECT_EQ(scene.GetElevNoDataValue(), 7.0f);   // empty: unchanged

    // The first of several is read; numbers out of range saturate.
    e.optional =
        "<Mmseg>99999999999999999999</Mmseg><Mmseg>5</Mmseg>"
        "<OrthoNoDataValue>1e40</OrthoNoDataValue>";
    ReadInto(scene, Put("s.xml", e.Document()));
    EXPECT_EQ(scene.GetMmseg(), std::numeric_limits<int>::max());
    EXPECT_EQ(scene.GetOrthoNoDataValue(), std::numeric_limits<float>::infinity());
}

TEST_F(SceneRead, PointTextsSplitAtTabCommaAndSemicolon) {
    Elements e;
    e.footprint = Pts({"10.5;20.25", "11.5\t20.25", "\n 12.5 , 20.25 ,99\n", "abc,16"});
    TOSceneParser scene(Put("s.xml", e.Document()).c_str());
    const auto* footprint = scene.GetSceneFootprint();
    ASSERT_EQ(footprint->numPoints, 4u);
    for (unsigned int i = 0; i < 4; ++i) {
        EXPECT_EQ(footprint->points[i].x, i < 3 ? 10.5 + i : 0.0) << i;  // "abc" reads as 0
        EXPECT_EQ(footprint->points[i].y, i < 3 ? 20.25 : 16.0) << i;
    }
}

TEST_F(SceneRead, PointWithoutTwoCoordinatesIsRefusedNamingFileAndText) {
    for (const char* text : {"5", "", " ; ", "7,", "7, ,8"}) {
        Elements e;
        e.footprint = Pts({"1,2", text});
        const std::string path = Put("s.xml", e.Document());
        const std::string message = ReadError<DataException>(path);
        EXPECT_TRUE(Contains(message, path)) << message;
        EXPECT_TRUE(Contains(message, std::string("\"") + text + "\"")) << message;
    }
}

TEST_F(SceneRead, EachMissingRequiredElementOrPointlessFootprintIsReported) {
    for (int missing = 0; missing < 6; ++missing) {
        Elements e;
        std::string* parts[] = {&e.source, &e.ortho, &e.visIdx, &e.elevMap, &e.footprint};
        if (missing < 5)
            parts[missing]->clear();
        else
            e.footprint = "<SceneFootprint></SceneFootprint>";
        const std::string path = Put("s.xml", e.Document());
        TOSceneParser scene;
        if (const auto err = testsupport::Thrown<FileAccessException>(
                [&] { ReadInto(scene, path); }, "case " + std::to_string(missing))) {
            EXPECT_EQ(err->GetErrorMessage(),
                      " Error in parsing " + path + " XML file. Some tags are missing.\n");
            EXPECT_EQ(err->GetFileName(), "");
            EXPECT_EQ(static_cast<int>(err->GetType()), 1);
            testsupport::ExpectThrownFrom(
                *err, "virtual void kestrel::processes::silvan::TOSceneParser::ReadXMLFile()",
                "tosceneparser.cpp");
        }
        // Reading stops at the gap; a footprint without points is kept as an empty polygon.
        EXPECT_EQ(scene.GetVisIdxFilename(), missing <= 2 ? "" : "vis.tif") << missing;
        const auto* footprint = scene.GetSceneFootprint();
        EXPECT_EQ(footprint ? static_cast<int>(footprint->numPoints) : -1, missing < 4 ? -1 : 0);
    }
}

TEST_F(SceneRead, EscapesEntitiesLongTextsAndCharacterSetsGiveBytes) {
    Elements e;
    e.source = "<SourceRaster>a&amp;b&lt;&#233;<![CDATA[<x>]]>&quot;</SourceRaster>";
    e.ortho = "<OrthoRaster>&e;</OrthoRaster>";
    e.visIdx = "<VisIdxmapRaster>" + std::string(300, 'n') + "</VisIdxmapRaster>";
    const std::string doctype = "<!DOCTYPE TOSceneDesc_Document [<!ENTITY e \"inner\">]>\n";
    TOSceneParser latin(Put("l.xml", e.Document(doctype)).c_str());
    EXPECT_EQ(latin.GetSceneFilename(), "a&b<\xE9<x>\"");
    EXPECT_EQ(latin.GetOrthoFilename(), "inner");
    EXPECT_EQ(latin.GetVisIdxFilename(), std::string(300, 'n'));

    // A UTF-8 document: characters up to U+00FF become their byte; others are refused.
    e.ortho = "<OrthoRaster>caf\xC3\xA9</OrthoRaster>";
    std::string utf8 = e.Document();
    utf8.replace(utf8.find("ISO-8859-1"), 10, "UTF-8");
    TOSceneParser unicode(Put("u.xml", utf8).c_str());
    EXPECT_EQ(unicode.GetOrthoFilename(), "caf\xE9");

    e.elevMap = "<ElevMapRaster>&#x65E5;.tif</ElevMapRaster>";
    const std::string message = ReadError<DataException>(Put("s.xml", e.Document()));
    EXPECT_TRUE(Contains(message, "U+65E5") && Contains(message, "ElevMapRaster")) << message;
}

// Text nested far deeper than any scene file nests is read without exhausting the stack.
TEST_F(SceneRead, DeeplyNestedTextIsRead) {
    Elements e;
    const int depth = 200000;
    std::string nested;
    for (int i = 0; i < depth; ++i)
        nested += "<a>";
    nested += "deep.tif";
    for (int i = 0; i < depth; ++i)
        nested += "</a>";
    e.source = "<SourceRaster>" + nested + "</SourceRaster>";
    TOSceneParser scene(Put("deep.xml", e.Document()).c_str());
    EXPECT_EQ(scene.GetSceneFilename(), "deep.tif");
}

#if defined(__linux__)
// A pipe is read like a file.
TEST_F(SceneRead, PipeIsRead) {
    const std::string fifo = dir.File("fifo");
    ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
    std::thread writer([&fifo] { WriteFile(fifo, Elements().Document()); });
    TOSceneParser scene(fifo.c_str());
    writer.join();
    EXPECT_EQ(scene.GetSceneFilename(), "src.tif");
}
#endif

// What is no scene description, or would make the reader fetch other files, expand entities or
// fill the memory without bound, is refused naming the file (and, for malformed XML, the
// position) and what is wrong; nothing fetched shows in the message.
TEST_F(SceneRead, UnreadableOrUnsafeFilesAreRefusedNamingFileAndWhy) {
    const std::string whole = Elements().Document();
    std::string other = whole;
    for (const char* tag : {"<TOSceneDesc_Document>", "</TOSceneDesc_Document>"})
        other.replace(other.find(tag), std::strlen(tag), tag[1] == '/' ? "</Other>" : "<Other>");
    const std::string secret = Put("secret.txt", "TOPSECRET");
    // A billion laughs, and one large entity referenced many times (in text and in an attribute).
    std::string laughs = "<!DOCTYPE TOSceneDesc_Document [<!ENTITY l0 \"lol\">";
    for (int i = 1; i <= 9; ++i) {
        laughs += "<!ENTITY l" + std::to_string(i) + " \"";
        for (int j = 0; j < 10; ++j)
            laughs += "&l" + std::to_string(i - 1) + ";";
        laughs += "\">";
    }
    const std::string big =
        "<!DOCTYPE TOSceneDesc_Document [<!ENTITY a \"" + std::string(200000, 'A') + "\">]>\n";
    std::string refs;
    for (int i = 0; i < 60; ++i)
        refs += "&a;";
    const auto withSource = [](const std::string& source, const std::string& doctype) {
        Elements e;
        e.source = source;
        return e.Document(doctype);
    };
    const struct {
        const char* name;
        std::string bytes;
        std::vector<std::string> parts;  // in the message, besides the file's name
    } cases[] = {
        {"empty.xml", "", {"line 1", "column"}},
        {"cut.xml", whole.substr(0, whole.size() / 2), {"line 3", "column"}},
        {"mismatch.xml",
         "<?xml version=\"1.0\"?>\n<TOSceneDesc_Document>\n<Pt>1,2</Mmseg>\n",
         {"line 3", "column"}},
        {"text.xml", "not xml at all", {"line 1", "column"}},
        {"twice.xml", whole + "<TOSceneDesc_Document/>", {"line 5", "column"}},
        {"other.xml", other, {"\"Other\""}},
        {"general.xml",
         withSource("<SourceRaster>&leak;</SourceRaster>",
                    "<!DOCTYPE TOSceneDesc_Document [<!ENTITY leak SYSTEM \"" + secret + "\">]>\n"),
         {"external"}},
        {"parameter.xml",
         withSource(
             "<SourceRaster>x</SourceRaster>",
             "<!DOCTYPE TOSceneDesc_Document [<!ENTITY % p SYSTEM \"" + secret + "\"> %p;]>\n"),
         {}},
        {"laughs.xml",
         withSource("<SourceRaster>&l9;</SourceRaster>", laughs + "]>"),
         {"entity expansions"}},
        {"quadratic.xml",
         withSource("<SourceRaster>" + refs + "</SourceRaster>", big),
         {"entity expansion"}},
        {"attribute.xml", withSource("<SourceRaster a=\"" + refs + "\">x</SourceRaster>", big), {}},
    };
    for (const auto& c : cases) {
        const std::string path = Put(c.name, c.bytes);
        const std::string message = ReadError(path);
        for (const std::string& part : c.parts)
            EXPECT_TRUE(Contains(message, part)) << c.name << ": " << message;
        EXPECT_TRUE(Contains(message, path)) << c.name << ": " << message;
        EXPECT_FALSE(Contains(message, "TOPSECRET")) << c.name;
    }
    const std::string missing = dir.File("none.xml");
    EXPECT_TRUE(Contains(ReadError<kestrel::FileNotFoundException>(missing), missing));
    ReadError(dir.Path().string());
#if defined(__linux__)
    EXPECT_TRUE(Contains(ReadError("/dev/zero"), "larger than 64 MiB"));
#endif

    // Escapes are not entities: many of them are read.
    std::string escaped;
    for (int i = 0; i < 5000; ++i)
        escaped += "&amp;&#65;";
    TOSceneParser scene(
        Put("escaped.xml", withSource("<SourceRaster>" + escaped + "</SourceRaster>", "")).c_str());
    EXPECT_EQ(scene.GetSceneFilename().size(), 10000u);
}

TEST_F(SceneRead, ExternalDtdIsNeitherNeededNorFetched) {
    // A DTD that would add an entity and make the file invalid is not read.
    Put("evil.dtd", "<!ENTITY x SYSTEM \"/etc/passwd\"><!ELEMENT Nothing EMPTY>");
    for (const char* system :
         {"evil.dtd", "TOSceneDesc_Document.dtd", "http://127.0.0.1:9/unreachable.dtd"}) {
        const std::string doctype =
            std::string("<!DOCTYPE TOSceneDesc_Document SYSTEM \"") + system + "\">\n";
        TOSceneParser scene(Put("s.xml", Elements().Document(doctype)).c_str());
        EXPECT_EQ(scene.GetSceneFilename(), "src.tif") << system;
    }
}

namespace {

// Reaches the fixed-buffer lookup of the XML base.
class BufferReader : public kestrel::XMLParser {
  public:
    using XMLParser::XMLParser;
    std::string text;

  private:
    std::string GetDocNameTag() const override { return "Doc"; }
    void AddElementsToDocument() override {}
    void ReadXMLFile() override {
        char buffer[kTagTextSize];
        if (ReadTagFromFile("Name", buffer))
            text = buffer;
    }
};

}  // namespace

TEST_F(SceneRead, FixedBufferLookupRefusesTextsThatDoNotFit) {
    const std::string fits(kestrel::XMLParser::kTagTextSize - 1, 'f');
    BufferReader reader(Put("a.xml", "<Doc><Name>" + fits + "</Name></Doc>").c_str());
    reader.Serialize(true);
    EXPECT_EQ(reader.text, fits);
    BufferReader tooLong(Put("b.xml", "<Doc><Name>" + fits + "x</Name></Doc>").c_str());
    EXPECT_THROW(tooLong.Serialize(true), DataException);
}
