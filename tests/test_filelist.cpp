// The file-list parser and the parser core it shares with the other parameter-file parsers.
#include <silvan/filelistparser.h>

#include "support.h"

using kestrel::DataException;
using kestrel::processes::silvan::FileListParser;
using testsupport::ExpectThrownFrom;
using testsupport::TempDir;
using testsupport::WriteFile;

namespace {

const char* const kParseLine = "void kestrel::processes::silvan::FileListParser::ParseLine(int)";

std::string ThreeFiles(const TempDir& dir) {
    return WriteFile(dir.File("list.txt"), "!MFILE\na.tif\nsub/b.tif\nc d.tif\n");
}

void ExpectRangeError(FileListParser& files, int index, const std::string& message) {
    try {
        files.ParseLine(index);
        FAIL() << "index " << index << " was accepted";
    } catch (const DataException& e) {
        EXPECT_EQ(e.GetErrorMessage(), message);
        ExpectThrownFrom(e, kParseLine, "filelistparser.cpp");
    }
}

}  // namespace

TEST(FileListParser, ReadsLinesByIndexInAnyOrder) {
    TempDir dir;
    FileListParser files(ThreeFiles(dir));
    EXPECT_EQ(files.GetMfileLines(), 3u);
    EXPECT_EQ(files.GetFili(), "");
    files.ParseLine(2);
    EXPECT_EQ(files.GetFili(), "c d.tif");
    files.ParseLine(0);
    EXPECT_EQ(files.GetFili(), "a.tif");
    files.ParseLine(0);
    EXPECT_EQ(files.GetFili(), "a.tif");
    files.ParseLine(1);
    EXPECT_EQ(files.GetFili(), "sub/b.tif");
    EXPECT_EQ(files.GetMfileLines(), 3u);
}

TEST(FileListParser, IndexOutsideTheLinesIsRefusedAndKeepsTheCurrentLine) {
    TempDir dir;
    FileListParser files(ThreeFiles(dir));
    files.ParseLine(1);
    ExpectRangeError(files, 3, "Index 3 is outside of valid range: 3");
    ExpectRangeError(files, -1, "Index -1 is outside of valid range: 3");
    ExpectRangeError(files, -2147483647 - 1, "Index -2147483648 is outside of valid range: 3");
    EXPECT_EQ(files.GetFili(), "sub/b.tif");
}

TEST(FileListParser, EmptyFieldReadsAsEmptyName) {
    TempDir dir;
    FileListParser files(WriteFile(dir.File("list.txt"), "a.tif\n ;x\n"));
    files.ParseLine(1);
    EXPECT_EQ(files.GetFili(), "");
}
