// The image-set parser: typed scene lines, radiometric difference levels, defaults and errors.
#include <silvan/toimgsetparser.h>

#include "support.h"

using kestrel::processes::silvan::TOImgSetParser;
using testsupport::TempDir;
using testsupport::WriteFile;

namespace {

std::string WriteImgSet(const TempDir& dir, const std::string& lines) {
    return WriteFile(dir.File("imgset.txt"), "!IMGSET created for MELDRA\n" + lines);
}

}  // namespace

TEST(TOImgSetParser, ReadsTypedLinesAndEncodesLevels) {
    TempDir dir;
    const struct {
        const char* line;
        const char* sceneId;
        RadiometricDiff level;
        int pxErr;
    } cases[] = {
        {"scene1;moderate;2", "scene1", RadioDifModerate, 2},
        {"s2;High;-7", "s2", RadioDifHigh, -7},
        {"s3;HIGHER;0", "s3", RadioDifHigh, 0},
        {"s4;high ;1", "s4", RadioDifHigh, 1},
        {"s5;medium;3", "s5", RadioDifAny, 3},
        {"s6;lowest;4", "s6", RadioDifLow, 4},
        {"s7;VeryLow;5", "s7", RadioDifAny, 5},
        {"s8;any;6", "s8", RadioDifAny, 6},
        {"s9;hig;8", "s9", RadioDifAny, 8},
    };
    std::string lines;
    for (const auto& c : cases)
        lines += std::string(c.line) + "\n";
    TOImgSetParser parser(WriteImgSet(dir, lines), RadioDifLow, 99);

    EXPECT_EQ(parser.GetSceneId(), "");
    EXPECT_EQ(parser.GetRadioDif(), RadioDifAny);
    EXPECT_EQ(parser.GetDbmPxErr(), 0);
    ASSERT_EQ(parser.GetMfileLines(), 9u);
    // Backwards, so that nothing depends on reading in file order.
    for (int i = 8; i >= 0; --i) {
        parser.ParseLine(i);
        EXPECT_EQ(parser.GetSceneId(), cases[i].sceneId);
        EXPECT_EQ(parser.GetRadioDif(), cases[i].level) << cases[i].line;
        EXPECT_EQ(parser.GetDbmPxErr(), cases[i].pxErr);
    }
}

// The constructor's level is registered as its text and read back through the encoding, so
// each level survives the round trip and any other value reads as RadioDifAny.
TEST(TOImgSetParser, ColumnsLeftOutReadAsConstructorDefaults) {
    TempDir dir;
    const std::string path = WriteImgSet(dir, "only\n;;\n");
    const RadiometricDiff levels[] = {RadioDifAny, RadioDifLow, RadioDifModerate, RadioDifHigh};
    for (const RadiometricDiff level : levels) {
        TOImgSetParser parser(path, level, 5);
        for (int line = 0; line < 2; ++line) {
            parser.ParseLine(line);
            EXPECT_EQ(parser.GetRadioDif(), level);
            EXPECT_EQ(parser.GetDbmPxErr(), 5);
        }
        EXPECT_EQ(parser.GetSceneId(), "");
    }
    for (const int outside : {-1, 4, 1000}) {
        TOImgSetParser parser(path, static_cast<RadiometricDiff>(outside), -3);
        parser.ParseLine(0);
        EXPECT_EQ(parser.GetRadioDif(), RadioDifAny);
        EXPECT_EQ(parser.GetDbmPxErr(), -3);
    }
}
