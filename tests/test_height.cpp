// silvan-height against gdallocationinfo -valonly at the posts of a raster DEM, a tile index of
// it and a TIN of its posts, and its answers to bad arguments and input lines.
#include "demdata.h"
#include "support.h"

#include <filesystem>
#include <random>
#include <sstream>

#include <ogrsf_frmts.h>

using testsupport::Grid;
using testsupport::RunCommand;

namespace {

const Grid kGrid{514000, 5035000, 10, 60, 50};
const std::string kTool = std::string(SILVAN_TOOLS_DIR) + "/silvan-height";

float Post(int i, int j) {
    return (i * 7 + j * 3) % 29 == 0 ? -32768.0f : static_cast<float>(200 + i - 0.37 * j);
}

std::vector<std::string> Lines(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);)
        lines.push_back(line);
    return lines;
}

class Height : public ::testing::Test {
  protected:
    void SetUp() override {
        if (!std::filesystem::exists(kTool))
            GTEST_SKIP() << "silvan-height is not built";
        testsupport::WriteDem(dir.File("dem.tif"), kGrid, "EPSG:32632+5773", Post, {}, true);
        // Posts, in random order, and the points of the first line and column.
        std::mt19937 random(3);
        std::string points;
        for (int k = 0; k < 300; ++k) {
            const int i = static_cast<int>(random() % kGrid.width);
            const int j = static_cast<int>(random() % kGrid.height);
            points += std::to_string(kGrid.X(i)) + " " + std::to_string(kGrid.Y(j)) + "\n";
        }
        input = testsupport::WriteFile(dir.File("points.txt"), points);
    }

    std::string Tool(const std::string& arguments) {
        return RunCommand("'" + kTool + "' " + arguments + " < '" + input + "' 2>&1");
    }

    testsupport::TempDir dir;
    std::string input;
};

}  // namespace

TEST_F(Height, AgreesWithGdallocationinfoAtPosts) {
    const auto expected = Lines(RunCommand("gdallocationinfo -valonly -geoloc '" +
                                           dir.File("dem.tif") + "' < '" + input + "'"));
    ASSERT_EQ(expected.size(), 300u);
    RunCommand("cd '" + dir.Path().string() +
               "' && gdaltindex -f GPKG index.gpkg dem.tif >/dev/null");
    // The posts as 3-D points of a TIN, holes left out.
    {
        GDALDatasetUniquePtr ds(GetGDALDriverManager()->GetDriverByName("GPKG")->Create(
            dir.File("tin.gpkg").c_str(), 0, 0, 0, GDT_Unknown, nullptr));
        OGRSpatialReference srs;
        srs.SetFromUserInput("EPSG:32632+5773");
        OGRLayer* layer = ds->CreateLayer("posts", &srs, wkbPoint25D, nullptr);
        for (int j = 0; j < kGrid.height; ++j) {
            for (int i = 0; i < kGrid.width; ++i) {
                if (Post(i, j) == -32768.0f)
                    continue;
                OGRFeature feature(layer->GetLayerDefn());
                feature.SetGeometry(
                    std::make_unique<OGRPoint>(kGrid.X(i), kGrid.Y(j), Post(i, j)).get());
                ASSERT_EQ(layer->CreateFeature(&feature), OGRERR_NONE);
            }
        }
    }
    for (const char* dem : {"dem.tif", "index.gpkg", "tin.gpkg"}) {
        const auto got = Lines(Tool("'" + dir.File(dem) + "'"));
        ASSERT_EQ(got.size(), expected.size()) << dem;
        for (std::size_t k = 0; k < got.size(); ++k) {
            if (expected[k] == "-32768") {
                // gdallocationinfo prints the no-data value; a hole in the TIN is bridged.
                EXPECT_TRUE(got[k].empty() || std::string(dem) == "tin.gpkg")
                    << dem << " line " << k + 1;
            } else {
                ASSERT_FALSE(got[k].empty()) << dem << " line " << k + 1;
                EXPECT_NEAR(std::stod(got[k]), std::stod(expected[k]), 1e-4)
                    << dem << " line " << k + 1;
            }
        }
    }
}

TEST_F(Height, ConvertsOnRequest) {
    // printf "514015 5034995 201\n" | cs2cs -d 6 EPSG:32632+5773 EPSG:4979 -> 243.586745
    input = testsupport::WriteFile(dir.File("one.txt"), "514015 5034995\n");
    EXPECT_EQ(Tool("'" + dir.File("dem.tif") + "'"), "201\n");
    const std::string converted = Tool("'" + dir.File("dem.tif") + "' --to ellips");
    EXPECT_NEAR(std::stod(converted), 243.586745, 1e-3) << converted;
}

TEST_F(Height, BadArgumentsAndLinesAreNamed) {
    const std::string dem = "'" + dir.File("dem.tif") + "'";
    EXPECT_NE(Tool("--help").find("usage: silvan-height DEM"), std::string::npos);
    const std::pair<std::string, std::string> cases[] = {
        {"", "no DEM given"},
        {dem + " --bogus", "unknown option \"--bogus\""},
        {dem + " --to", "option --to needs a value"},
        {dem + " --to GEOID", "a value of GEOID was entered"},
        {dem + " --srs EPSG:99999", "EPSG:99999"},
        {"'" + dir.File("none.tif") + "'", dir.File("none.tif")},
    };
    for (const auto& c : cases) {
        const std::string output =
            RunCommand("'" + kTool + "' " + c.first + " </dev/null 2>&1; echo rc=$?");
        EXPECT_NE(output.find(c.second), std::string::npos) << c.first << ": " << output;
        EXPECT_EQ(output.find("rc=0"), std::string::npos) << c.first;
    }
    input = testsupport::WriteFile(dir.File("bad.txt"), "514015 5034995\n514005 north\n");
    const std::string output =
        RunCommand("'" + kTool + "' " + dem + " < '" + input + "' 2>&1; echo rc=$?");
    EXPECT_EQ(output.find("201\n"), 0u) << output;
    EXPECT_NE(output.find("line 2 is not \"x y\": \"514005 north\""), std::string::npos) << output;
    EXPECT_EQ(output.find("rc=0"), std::string::npos);
}
