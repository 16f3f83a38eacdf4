// silvan-height against gdallocationinfo -valonly at the posts of a raster DEM, a tile index of
// it and a TIN of its posts; against gdallocationinfo plus cs2cs for every combination of unit,
// datum and vertical CRS; and its (and silvan-ortho's) answers to bad arguments and input lines.
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

namespace {

std::string Wkt(const OGRSpatialReference& srs) {
    char* wkt = nullptr;
    const char* options[] = {"FORMAT=WKT2_2019", "MULTILINE=NO", nullptr};
    srs.exportToWkt(&wkt, options);
    std::string text = wkt;
    CPLFree(wkt);
    return text;
}

// Compound systems whose heights are above EGM96 in feet: EPSG has no code for them.
std::string Egm96InFeet(const char* unit, double metres) {
    OGRSpatialReference utm, vertical, compound;
    utm.importFromEPSG(32632);
    vertical.importFromEPSG(5773);
    vertical.SetLinearUnits(unit, metres);
    compound.SetCompoundCS("UTM 32N + EGM96 height in feet", &utm, &vertical);
    return Wkt(compound);
}

// EPSG:32632 with ellipsoidal heights.
std::string Utm3D() {
    OGRSpatialReference utm;
    utm.importFromEPSG(32632);
    utm.PromoteTo3D(nullptr);
    return Wkt(utm);
}

}  // namespace

// silvan-height against gdallocationinfo (the stored value) plus cs2cs (the unit and datum that
// the file, or else the options, give the value) at posts, asked in UTM or Web Mercator.
TEST(HeightDatums, AgreeWithGdallocationinfoPlusCs2cs) {
    if (!std::filesystem::exists(kTool))
        GTEST_SKIP() << "silvan-height is not built";
    testsupport::TempDir dir;
    const std::string feet = Egm96InFeet("foot", 0.3048);
    const std::string usFeet = Egm96InFeet("US survey foot", 1200.0 / 3937.0);
    const std::string utm3d = Utm3D();
    const Grid utm{514000, 5035000, 10, 12, 9};
    const Grid ny{585000, 4511000, 10, 12, 9};
    const auto value = [](int i, int j) { return static_cast<float>(300 + 3 * i - 0.37 * j); };
    const auto write = [&](const std::string& name, const Grid& grid, const std::string& crs) {
        const std::string path = dir.File(name);
        if (name.size() > 4 && name.substr(name.size() - 4) == ".vrt") {
            // GeoTIFF cannot keep a vertical unit without an EPSG code; a VRT keeps any CRS.
            testsupport::WriteDem(path + ".tif", grid, "", value);
            testsupport::WriteFile(path + ".wkt", crs);
            RunCommand("gdal_translate -q -of VRT -a_srs '" + path + ".wkt' '" + path + ".tif' '" +
                       path + "'");
        } else {
            testsupport::WriteDem(path, grid, crs, value);
        }
        return path;
    };
    write("msl.tif", utm, "EPSG:32632+5773");
    write("none.tif", utm, "EPSG:32632");
    write("ft.vrt", utm, feet);
    write("navd88ftus.tif", ny, "EPSG:26918+6360");

    struct Case {
        const char* file;
        const char* options;    // silvan-height's
        const char* pointsCrs;  // of the points given; empty: the file's
        std::string from, to;   // cs2cs: what the stored value means, what is printed
    };
    const Case cases[] = {
        // A vertical CRS in metres: converted only when another datum is asked for.
        {"msl.tif", "", "", "EPSG:32632+5773", "EPSG:32632+5773"},
        {"msl.tif", "--to ELLIPS", "", "EPSG:32632+5773", "EPSG:4979"},
        {"msl.tif", "--to ELLIPS", "EPSG:3857", "EPSG:32632+5773", "EPSG:4979"},
        {"msl.tif", "--elevref MSL --elunits METRE --to ELLIPS", "", "EPSG:32632+5773",
         "EPSG:4979"},
        // In feet: metres in any case, with or without a datum shift; --elunits naming the
        // file's own unit converts once.
        {"ft.vrt", "", "", feet, "EPSG:32632+5773"},
        {"ft.vrt", "--to ELLIPS", "", feet, "EPSG:4979"},
        {"ft.vrt", "--elunits FOOT --to ELLIPS", "EPSG:3857", feet, "EPSG:4979"},
        {"navd88ftus.tif", "", "", "EPSG:26918+6360", "EPSG:26918+5703"},
        {"navd88ftus.tif", "--elunits US_FOOT", "EPSG:3857", "EPSG:26918+6360", "EPSG:26918+5703"},
        // No vertical CRS: --elevref and --elunits say what the values are.
        {"none.tif", "", "", "EPSG:32632+5773", "EPSG:32632+5773"},
        {"none.tif", "--to ELLIPS", "EPSG:3857", "EPSG:32632+5773", "EPSG:4979"},
        {"none.tif", "--elevref ELLIPS", "", utm3d, "EPSG:4979"},
        {"none.tif", "--elevref ELLIPS --to MSL", "", utm3d, "EPSG:32632+5773"},
        {"none.tif", "--elunits US_FOOT --to ELLIPS", "", usFeet, "EPSG:4979"},
        {"none.tif", "--elunits FT --elevref MSL", "EPSG:3857", feet, "EPSG:32632+5773"},
    };
    for (const Case& c : cases) {
        const std::string file = dir.File(c.file);
        const Grid& grid = std::string(c.file) == "navd88ftus.tif" ? ny : utm;
        const std::string fileCrs =
            std::string(c.file) == "navd88ftus.tif" ? "EPSG:26918" : "EPSG:32632";
        std::string posts;
        for (int k = 0; k < 6; ++k)
            posts += std::to_string(grid.X(2 * k % 11)) + " " + std::to_string(grid.Y(k)) + "\n";
        // The posts in the CRS of the points given (cs2cs writes "x<tab>y z": x and y kept).
        const std::string points =
            *c.pointsCrs == '\0' ? posts
                                 : RunCommand("printf '" + posts + "' | cs2cs -f %.9f " + fileCrs +
                                              " " + c.pointsCrs + " | awk '{print $1, $2}'");
        const std::string input = testsupport::WriteFile(dir.File("points.txt"), points);
        const std::string srs =
            *c.pointsCrs != '\0' ? std::string(" -l_srs ") + c.pointsCrs : " -geoloc";
        const auto stored = Lines(
            RunCommand("gdallocationinfo -valonly" + srs + " '" + file + "' < '" + input + "'"));
        ASSERT_EQ(stored.size(), 6u) << c.file;
        std::string triples;
        const auto postLines = Lines(posts);
        for (int k = 0; k < 6; ++k)
            triples += postLines[k] + " " + stored[k] + "\n";
        const auto expected = Lines(
            RunCommand("printf '" + triples + "' | cs2cs -f %.6f '" + c.from + "' '" + c.to + "'"));
        const std::string options =
            std::string(c.options) +
            (*c.pointsCrs != '\0' ? std::string(" --srs ") + c.pointsCrs : "");
        const auto got = Lines(
            RunCommand("'" + kTool + "' '" + file + "' " + options + " < '" + input + "' 2>&1"));
        ASSERT_EQ(expected.size(), 6u) << c.file << " " << options;
        ASSERT_EQ(got.size(), 6u) << c.file << " " << options << ": " << got[0];
        for (int k = 0; k < 6; ++k) {
            std::istringstream in(expected[k]);
            double a, b, h;
            in >> a >> b >> h;
            EXPECT_NEAR(std::stod(got[k]), h, 1e-3) << c.file << " " << options << " point " << k;
        }
    }

    // What contradicts the file is refused, naming the option, by silvan-height and by
    // silvan-ortho before any work; never applied on top of it.
    const std::string ortho = std::string(SILVAN_TOOLS_DIR) + "/silvan-ortho '" +
                              dir.File("master.txt") + "' --out '" + dir.File("out") + "' --dem ";
    const std::pair<std::string, std::string> refused[] = {
        {"msl.tif --elevref ELLIPS", "not ELLIPS as --elevref says"},
        {"ft.vrt --elunits METER", "not in METER as --elunits says"},
        {"navd88ftus.tif --elunits FOOT", "not in FOOT as --elunits says"},
        {"index.gpkg --elevref MSL", "nor a VERTICAL_DATUM item"},
    };
    RunCommand("cd '" + dir.Path().string() + "' && gdaltindex -f GPKG index.gpkg none.tif");
    for (const auto& r : refused) {
        for (const std::string& tool : {"'" + kTool + "' ", ortho}) {
            const std::string output = RunCommand(tool + dir.Path().string() + "/" + r.first +
                                                  " </dev/null 2>&1; echo rc=$?");
            EXPECT_NE(output.find(r.second), std::string::npos) << r.first << ": " << output;
            EXPECT_NE(output.find("rc=2"), std::string::npos) << r.first << ": " << output;
        }
    }
    EXPECT_FALSE(std::filesystem::exists(dir.File("out")));
}

// The change of datum between nodes of its lattice: random points over 120 km of mountains, where
// the geoid's slope changes most, against cs2cs.
TEST(HeightDatums, ShiftBetweenLatticeNodesAgreesWithCs2cs) {
    if (!std::filesystem::exists(kTool))
        GTEST_SKIP() << "silvan-height is not built";
    testsupport::TempDir dir;
    const Grid grid{300000, 3150000, 1000, 120, 120};  // UTM 45N: the Himalaya
    const std::string file = dir.File("flat.tif");
    testsupport::WriteDem(file, grid, "EPSG:32645+5773", [](int, int) { return 500.0f; });
    std::mt19937 random(7);
    std::uniform_real_distribution<double> across(grid.X(0), grid.X(grid.width - 1));
    std::uniform_real_distribution<double> down(grid.Y(grid.height - 1), grid.Y(0));
    std::string points, triples;
    for (int k = 0; k < 300; ++k) {
        char text[80];
        std::snprintf(text, sizeof text, "%.3f %.3f", across(random), down(random));
        points += std::string(text) + "\n";
        triples += std::string(text) + " 500\n";
    }
    testsupport::WriteFile(dir.File("points.txt"), points);
    const auto expected = Lines(RunCommand("printf '" + triples +
                                           "' | cs2cs -f %.6f EPSG:32645+5773 EPSG:4979"));
    const auto got = Lines(RunCommand("'" + kTool + "' '" + file + "' --to ELLIPS < '" +
                                      dir.File("points.txt") + "' 2>&1"));
    ASSERT_EQ(expected.size(), 300u);
    ASSERT_EQ(got.size(), 300u) << got[0];
    double worst = 0;
    for (std::size_t k = 0; k < got.size(); ++k) {
        std::istringstream in(expected[k]);
        double a, b, h;
        in >> a >> b >> h;
        worst = std::max(worst, std::fabs(std::stod(got[k]) - h));
    }
    EXPECT_LT(worst, 1e-3);
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
