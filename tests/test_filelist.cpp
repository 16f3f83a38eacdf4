// The file-list parser and the parser core it shares with the other parameter-file parsers.
#include <silvan/filelistparser.h>

#include "support.h"

#include <climits>

using kestrel::DataException;
using kestrel::processes::silvan::FileListParser;
using testsupport::TempDir;
using testsupport::WriteFile;

// Lines are read by index in any order, an empty field as an empty name; an index outside the
// lines is refused and keeps the current line.
TEST(FileListParser, ReadsLinesByIndexAndRefusesIndicesOutsideThem) {
    TempDir dir;
    FileListParser files(
        WriteFile(dir.File("list.txt"), "!MFILE\na.tif\nsub/b.tif\nc d.tif\n ;x\n"));
    EXPECT_EQ(files.GetMfileLines(), 4u);
    EXPECT_EQ(files.GetFili(), "");
    const std::pair<int, const char*> reads[] = {
        {2, "c d.tif"}, {0, "a.tif"}, {0, "a.tif"}, {3, ""}, {1, "sub/b.tif"}};
    for (const auto& [index, name] : reads) {
        files.ParseLine(index);
        EXPECT_EQ(files.GetFili(), name) << index;
    }
    for (const int index : {4, -1, INT_MIN}) {
        if (const auto e = testsupport::Thrown<DataException>([&] { files.ParseLine(index); })) {
            EXPECT_EQ(e->GetErrorMessage(),
                      "Index " + std::to_string(index) + " is outside of valid range: 4");
            testsupport::ExpectThrownFrom(
                *e, "void kestrel::processes::silvan::FileListParser::ParseLine(int)",
                "filelistparser.cpp");
        }
    }
    EXPECT_EQ(files.GetFili(), "sub/b.tif");
}
