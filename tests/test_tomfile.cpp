// The master parameter file parser and the preparation and image-set files it writes.
#include <silvan/tomfileparser.h>

#include "support.h"

#include <filesystem>

using kestrel::DataException;
using kestrel::FileAccessException;
using kestrel::MFileParser;
using kestrel::processes::silvan::TOMFileParser;
using testsupport::ReadFile;
using testsupport::TempDir;
using testsupport::WriteFile;

namespace {

// One line of every role kind, with fields left out and empty.
const char* const kMaster =
    "!MFILE master\n"
    "/img/a.tif;1,2,3;7;0,16;0;5;low;2;fill\n"
    "C:\\img\\b.tif;4;3;;0;5;high;1;FILL\n"
    "/img/c.tif;1;2;1,1;255;0;moderate;3;prep\n"
    "d.tif;1;2;1,1;255;0;any;4;Prep\n"
    "rel/e.tif;1;2;1,1;255;0;;;PREPARE\n"
    "f.tif;2;2;3;9;1;Low;0;XPREP\n"
    "g g.tif;3;2;3;9;1;HIGH;9;\n"
    "h.tif\n";

const char* const kExpectedPrep =
    "!MFILE created for VARNOK\n"
    "/img/a.tif;1,2,3;7;0,16;0;5\n"
    "C:\\img\\b.tif;4;3;;0;5\n"
    "/img/c.tif;1;2;1,1;255;0\n"
    "d.tif;1;2;1,1;255;0\n"
    "rel/e.tif;1;2;1,1;255;0\n"
    "f.tif;2;2;3;9;1\n"
    "g g.tif;3;2;3;9;1\n"
    "h.tif;;;;;\n";

const char* const kExpectedImgSet =
    "!IMGSET created for MELDRA\n"
    "a.tif;low;2\n"
    "b.tif;high;1\n"
    "f.tif;Low;0\n"
    "g g.tif;HIGH;9\n"
    "h.tif;;\n";

struct Master {
    TempDir dir;
    std::string path = WriteFile(dir.File("master.txt"), kMaster);
    TOMFileParser parser{path};
};

std::vector<std::string> PrepGetters(const TOMFileParser& p) {
    return {p.GetFili(), p.GetDbic(), p.GetMmseg(), p.GetDbiw(), p.GetSrcBgd(), p.GetEdgeClip()};
}
std::vector<std::string> FillGetters(const TOMFileParser& p) {
    return {p.GetRadioDif(), p.GetDbmPxErr(), p.GetRole()};
}

}  // namespace

TEST(TOMFileParser, WritesBothDerivedFilesByteForByte) {
    Master m;
    EXPECT_EQ(m.parser.GetMfileLines(), 8u);
    m.parser.WriteMFilePrep(m.dir.File("prep.txt"));
    m.parser.WriteImgSet(m.dir.File("imgset.txt"));
    EXPECT_EQ(ReadFile(m.dir.File("prep.txt")), kExpectedPrep);
    EXPECT_EQ(ReadFile(m.dir.File("imgset.txt")), kExpectedImgSet);
    EXPECT_EQ(m.parser.GetMfileLines(), 8u);
}

// Each writer reads only its own columns; the image-set writer upper-cases the role.
TEST(TOMFileParser, GettersHoldTheLastLineOfEachWritersMode) {
    TempDir dir;
    TOMFileParser parser(
        WriteFile(dir.File("m.txt"), "x.tif;1;2;3;4;5;low;2;fill\ny.tif;9;8;7;6;5;high;3;Prep\n"));
    EXPECT_EQ(PrepGetters(parser), std::vector<std::string>(6));
    EXPECT_EQ(FillGetters(parser), std::vector<std::string>(3));
    parser.WriteImgSet(dir.File("imgset.txt"));
    EXPECT_EQ(FillGetters(parser), (std::vector<std::string>{"high", "3", "PREP"}));
    EXPECT_EQ(parser.GetDbic(), "");
    parser.WriteMFilePrep(dir.File("prep.txt"));
    EXPECT_EQ(PrepGetters(parser), (std::vector<std::string>{"y.tif", "9", "8", "7", "6", "5"}));
    EXPECT_EQ(FillGetters(parser), (std::vector<std::string>{"high", "3", "PREP"}));
    EXPECT_EQ(ReadFile(dir.File("imgset.txt")), "!IMGSET created for MELDRA\nx.tif;low;2\n");
}

TEST(TOMFileParser, OnlyPrepRolesGiveAnImgSetWithTheHeaderAlone) {
    TempDir dir;
    TOMFileParser parser(WriteFile(dir.File("m.txt"), "x.tif;1;2;3;4;5;low;2;PREP\n"));
    parser.WriteImgSet(dir.File("imgset.txt"));
    parser.WriteMFilePrep(dir.File("prep.txt"));
    EXPECT_EQ(ReadFile(dir.File("imgset.txt")), "!IMGSET created for MELDRA\n");
    EXPECT_EQ(ReadFile(dir.File("prep.txt")), "!MFILE created for VARNOK\nx.tif;1;2;3;4;5\n");
}

// A file that cannot be created, or written, is an error, not a silent success.
TEST(TOMFileParser, UncreatableOrUnwritableOutputThrowsAndLeavesNoFile) {
    Master m;
    const std::string out = m.dir.File("no-such-dir/prep.txt");
    for (auto write : {&TOMFileParser::WriteMFilePrep, &TOMFileParser::WriteImgSet}) {
        if (const auto e =
                testsupport::Thrown<FileAccessException>([&] { (m.parser.*write)(out); }, out)) {
            EXPECT_EQ(e->GetFileName(), out);
            EXPECT_EQ(e->GetType(), FileAccessException::CreateFailed);
            EXPECT_EQ(static_cast<int>(e->GetType()), 5);
            EXPECT_TRUE(testsupport::Contains(e->GetErrorMessage(), out));
            EXPECT_EQ(e->GetSourceFile(), "tomfileparser.cpp");
            EXPECT_TRUE(testsupport::Contains(e->GetFunction(), "TOMFileParser::Write"));
        }
        EXPECT_FALSE(std::filesystem::exists(m.dir.File("no-such-dir")));
    }
    EXPECT_THROW(m.parser.WriteImgSet(m.dir.Path().string()), FileAccessException);
#if defined(__linux__)
    // A device that refuses every write: the failure surfaces when the lines are flushed.
    if (std::filesystem::exists("/dev/full")) {
        EXPECT_THROW(m.parser.WriteMFilePrep("/dev/full"), FileAccessException);
    }
#endif
}

// The parser keeps its own copy of the master file, so a derived file may replace it.
TEST(TOMFileParser, WritingOverItsOwnMasterFile) {
    Master m;
    m.parser.WriteMFilePrep(m.path);
    m.parser.WriteImgSet(m.dir.File("imgset.txt"));
    EXPECT_EQ(ReadFile(m.path), kExpectedPrep);
    EXPECT_EQ(ReadFile(m.dir.File("imgset.txt")), kExpectedImgSet);
}

// A record whose line in a derived file would begin with "!" would read back as a comment, so
// the file would lose it: refused naming the master file, line and value, and the previous
// output stays as it was.
TEST(TOMFileParser, RecordsThatWouldReadBackAsCommentsAreRefused) {
    TempDir dir;
    const std::string prep = WriteFile(dir.File("prep.txt"), "previous prep\n");
    const std::string imgset = WriteFile(dir.File("imgset.txt"), "previous imgset\n");
    const struct {
        const char* master;
        bool prepRefused;
        bool imgsetRefused;
        const char* value;
    } cases[] = {
        {"a.tif;1\n !bang.tif;1;2;3;4;5;low;2;fill\n", true, true, "!bang.tif"},
        {"a.tif;1\ndir/!b.tif;1;2;3;4;5;low;2;fill\n", false, true, "!b.tif"},
        {"a.tif;1\ndir/!b.tif;1;2;3;4;5;low;2;prep\n", false, false, ""},
    };
    for (const auto& c : cases) {
        const std::string master =
            WriteFile(dir.File("master.txt"), std::string("!M\n") + c.master);
        TOMFileParser parser(master);
        const std::pair<void (TOMFileParser::*)(const std::string&), const std::string*> writers[] =
            {{&TOMFileParser::WriteMFilePrep, &prep}, {&TOMFileParser::WriteImgSet, &imgset}};
        for (const auto& [write, out] : writers) {
            const bool refused = out == &prep ? c.prepRefused : c.imgsetRefused;
            const std::string before = ReadFile(*out);
            try {
                (parser.*write)(*out);
                EXPECT_FALSE(refused) << c.master << " written to " << *out;
            } catch (const DataException& e) {
                EXPECT_TRUE(refused) << e.GetErrorMessage();
                const std::string head = master + ", line 3, column 0: the ";
                EXPECT_EQ(e.GetErrorMessage().rfind(head, 0), 0u) << e.GetErrorMessage();
                EXPECT_NE(e.GetErrorMessage().find(std::string("\"") + c.value + "\""),
                          std::string::npos);
                EXPECT_EQ(ReadFile(*out), before);
            }
        }
    }
}
