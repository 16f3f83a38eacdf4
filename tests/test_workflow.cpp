// The workflow command, run as a user runs it: command line, derived files, errors that name
// the master line, summary. With the sample builder and the whole chain, the workflow end to end
// on a reduced sample city, and the rerun that does nothing.
#include "program.h"

#include <gdal_priv.h>
#include <ogrsf_frmts.h>

#include <silvan/silvan.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <memory>
#include <string>

namespace {

using testsupport::ReadFile;
using testsupport::TempDir;
using testsupport::WriteFile;

using Result = testsupport::ProgramResult;
using testsupport::RunProgram;

#ifdef SILVAN_ORTHO_EXE
const std::string kOrtho = SILVAN_ORTHO_EXE;

Result Ortho(const std::vector<std::string>& args, const TempDir& dir) {
    return RunProgram(kOrtho, args, dir);
}

TEST(WorkflowCommand, RefusesBadCommandLinesWithStatus2) {
    TempDir dir;
    const std::string master = WriteFile(dir.File("master.txt"), "a.tif\n");
    const std::string out = dir.File("out");
    const struct {
        std::vector<std::string> args;
        std::string message;
    } cases[] = {
        {{}, "the master parameter file is missing"},
        {{master, "--dem", "d.tif"}, "--out DIR is missing"},
        {{master, "--out", out}, "exactly one of --dem and --tin"},
        {{master, "--out", out, "--dem", "d.tif", "--tin", "t.gpkg"}, "exactly one of"},
        {{master, "--out", out, "--dem", "d.tif", "--jobs", "0"}, "--jobs: at least one job"},
        {{master, "--out", out, "--dem", "d.tif", "--jobs", "two"}, "\"two\" is not a whole"},
        {{master, "--out", out, "--dem", "d.tif", "--lines", "5:5"}, "empty slice"},
        {{master, "--out", out, "--dem", "d.tif", "--lines", "x:2"}, "--lines: \"x\""},
        {{master, "--out", out, "--dem", "d.tif", "--pixel-size", "-1"}, "is negative"},
        {{master, "--out", out, "--dem", "d.tif", "--pixel-size", "nan"}, "is not a number"},
        {{master, "--out", out, "--dem", "d.tif", "--elfactor", "1,x"}, "\"x\" is not a number"},
        {{master, "--out", out, "--dem"}, "--dem needs a value"},
        {{master, "--out", out, "--dem", "d.tif", "--frobnicate"}, "unknown option"},
        {{master, master, "--out", out, "--dem", "d.tif"}, "one master parameter file"},
    };
    for (const auto& c : cases) {
        const Result r = Ortho(c.args, dir);
        EXPECT_EQ(r.status, 2) << c.message;
        EXPECT_NE(r.err.find(c.message), std::string::npos) << r.err;
    }
    EXPECT_FALSE(std::filesystem::exists(out));

    const Result help = Ortho({"--help"}, dir);
    EXPECT_EQ(help.status, 0);
    EXPECT_NE(help.out.find("usage: silvan-ortho MASTER --out DIR"), std::string::npos);
}

TEST(WorkflowCommand, MissingMasterFileStopsNamingIt) {
    TempDir dir;
    const std::string dem = WriteFile(dir.File("d.tif"), "");
    const Result r = Ortho({dir.File("absent.txt"), "--out", dir.File("out"), "--dem", dem}, dir);
    EXPECT_EQ(r.status, 1);
    EXPECT_NE(r.err.find("absent.txt"), std::string::npos) << r.err;
    EXPECT_NE(r.err.find("Invalid MFILE"), std::string::npos) << r.err;
    EXPECT_NE(ReadFile(dir.File("out/summary.json")).find("\"status\": \"failed\""),
              std::string::npos);
}

// A master file whose second data line (line 4 of the file) has a bad channel list and whose
// third names a missing image: the run stops at the first, naming the master file and line;
// with --keep-going both are listed in the summary.
TEST(WorkflowCommand, BadMasterLinesNameFileAndLine) {
    TempDir dir;
    const std::string master = WriteFile(dir.File("master.txt"),
                                         "!MFILE master\n"
                                         "a.tif;1,2,3;0;;0;0;LOW;1;FILL\n"
                                         "\n"
                                         "b.tif;1,x;0;;0;0;HIGH;2;FILL\n"
                                         "a.tif;1;0;;0;0;;0;PREP\n"
                                         "c.tif;1;0;;0;0;;0;FILL\n");
    const std::string dem = WriteFile(dir.File("dsm.tif"), "");
    const Result stop = Ortho({master, "--out", dir.File("out"), "--dem", dem}, dir);
    EXPECT_EQ(stop.status, 1);
    EXPECT_NE(stop.err.find("master.txt, line 4, column 1: \"x\" is not an integer"),
              std::string::npos)
        << stop.err;

    // The derived files hold the master file's columns.
    EXPECT_EQ(ReadFile(dir.File("out/prep.txt")),
              "!MFILE created for VARNOK\na.tif;1,2,3;0;;0;0\nb.tif;1,x;0;;0;0\n"
              "a.tif;1;0;;0;0\nc.tif;1;0;;0;0\n");
    EXPECT_EQ(ReadFile(dir.File("out/imgset.txt")),
              "!IMGSET created for MELDRA\na.tif;LOW;1\nb.tif;HIGH;2\nc.tif;;0\n");

    const Result going =
        Ortho({master, "--out", dir.File("out"), "--dem", dem, "--keep-going", "-q"}, dir);
    EXPECT_EQ(going.status, 1);
    const std::string summary = ReadFile(dir.File("out/summary.json"));
    EXPECT_NE(summary.find("\"line\": 1, \"source\": \"b.tif\""), std::string::npos) << summary;
    EXPECT_NE(summary.find("master.txt, line 4, column 1"), std::string::npos);
    // The third line repeats the first one's name: its outputs would overwrite the first's.
    EXPECT_NE(summary.find("master.txt, line 5: the scene name \\\"a\\\" is already taken by "
                           "line 2"),
              std::string::npos)
        << summary;
    // A missing image is named with the line that names it.
    EXPECT_NE(summary.find("master.txt, line 6: " + dir.File("c.tif") + ": not found"),
              std::string::npos)
        << summary;
}

TEST(WorkflowCommand, SliceBeyondTheLastLineDoesNothing) {
    TempDir dir;
    const std::string master = WriteFile(dir.File("master.txt"), "a.tif;1;0;;0;0;;0;FILL\n");
    const std::string dem = WriteFile(dir.File("dsm.tif"), "");
    const Result r = Ortho({master, "--out", dir.File("out"), "--dem", dem, "--lines", "4:8"}, dir);
    EXPECT_EQ(r.status, 0) << r.err;
    const std::string summary = ReadFile(dir.File("out/summary-4-8.json"));
    EXPECT_NE(summary.find("\"scenes\": []"), std::string::npos) << summary;
    EXPECT_FALSE(std::filesystem::exists(dir.File("out/summary.json")));
}

#ifdef SILVAN_MAKE_SAMPLE_EXE
struct DatasetClose {
    void operator()(GDALDataset* dataset) const { GDALClose(dataset); }
};
using Dataset = std::unique_ptr<GDALDataset, DatasetClose>;

Dataset Open(const std::string& path, unsigned int flags = GDAL_OF_RASTER) {
    GDALAllRegister();
    return Dataset(GDALDataset::Open(path.c_str(), flags | GDAL_OF_READONLY, nullptr, nullptr));
}

std::vector<unsigned char> ReadBytes(GDALDataset& dataset) {
    const int w = dataset.GetRasterXSize(), h = dataset.GetRasterYSize();
    std::vector<unsigned char> values(static_cast<std::size_t>(w) * h);
    EXPECT_EQ(dataset.GetRasterBand(1)->RasterIO(GF_Read, 0, 0, w, h, values.data(), w, h, GDT_Byte,
                                                 0, 0, nullptr),
              CE_None);
    return values;
}

std::map<std::string, double> ModifiedTimes(const std::filesystem::path& dir) {
    std::map<std::string, double> times;
    for (const auto& entry : std::filesystem::directory_iterator(dir)) {
        if (entry.path().filename().string().rfind("summary", 0) == 0)
            continue;
        times[entry.path().filename().string()] =
            std::chrono::duration<double>(entry.last_write_time().time_since_epoch()).count();
    }
    return times;
}

// Values of the visibility index.
constexpr unsigned char kSeen = 1;
constexpr unsigned char kHidden = 2;

// The sample city at a reduced size, end to end: every output opens, on one grid, with the
// CRS asked for; buildings hide strips of ground in each image; the mosaic fills every pixel
// that some image sees; a second run changes nothing.
TEST(Workflow, SampleCityEndToEnd) {
    TempDir dir;
    const Result made = RunProgram(SILVAN_MAKE_SAMPLE_EXE,
                                   {dir.File("sample"), "--image-size", "192", "--quiet"}, dir);
    ASSERT_EQ(made.status, 0) << made.err;
    const std::vector<std::string> args = {dir.File("sample/master.txt"),
                                           "--out",
                                           dir.File("out"),
                                           "--dem",
                                           dir.File("sample/dsm.tif"),
                                           "--elevref",
                                           "ELLIPS",
                                           "--srs",
                                           "EPSG:32632",
                                           "--pixel-size",
                                           "1",
                                           "--jobs",
                                           "2",
                                           "--proc",
                                           "CPU:1",
                                           "--quiet"};
    const Result first = Ortho(args, dir);
    ASSERT_EQ(first.status, 0) << first.err;
    const std::string summary = ReadFile(dir.File("out/summary.json"));
    EXPECT_NE(summary.find("\"status\": \"complete\""), std::string::npos) << summary;

    // The scenes in the image set's order, in which the mosaic's source raster numbers them.
    std::vector<std::string> names;
    std::unique_ptr<kestrel::processes::silvan::TOImgSetParser> set(
        kestrel::processes::silvan::ParserFactory::CreateImgSetParser(dir.File("out/imgset.txt"),
                                                                      RadioDifAny, 0));
    for (unsigned int i = 0; i < set->GetMfileLines(); ++i) {
        set->ParseLine(static_cast<int>(i));
        names.push_back(std::filesystem::path(set->GetSceneId()).stem().string());
    }
    ASSERT_GE(names.size(), 3u);

    // One grid for all: same size and placement, whole blocks of 16, the CRS asked for.
    double geo[6] = {0}, first_geo[6] = {0};
    int width = 0, height = 0;
    std::vector<std::vector<unsigned char>> visibility;
    for (const std::string& name : names) {
        SCOPED_TRACE(name);
        const std::string xml = dir.File("out/" + name + ".xml");
        std::unique_ptr<kestrel::processes::silvan::TOSceneParser> scene(
            kestrel::processes::silvan::ParserFactory::CreateSceneParser(xml));
        EXPECT_EQ(scene->GetOrthoFilename(), dir.File("out/" + name + "_ortho.tif"));
        ASSERT_NE(scene->GetSceneFootprint(), nullptr);
        EXPECT_GE(scene->GetSceneFootprint()->numPoints, 4u);
        if (std::system("xmllint --version > /dev/null 2>&1") == 0) {
            EXPECT_EQ(std::system(("xmllint --valid --noout \"" + xml + "\"").c_str()), 0);
        }
        for (const std::string& raster : {scene->GetOrthoFilename(), scene->GetVisIdxFilename()}) {
            Dataset ds = Open(raster);
            ASSERT_TRUE(ds) << raster;
            ASSERT_EQ(ds->GetGeoTransform(geo), CE_None);
            if (width == 0) {
                width = ds->GetRasterXSize(), height = ds->GetRasterYSize();
                std::copy(geo, geo + 6, first_geo);
                EXPECT_EQ(width % 16, 0);
                EXPECT_EQ(height % 16, 0);
                EXPECT_DOUBLE_EQ(geo[1], 1.0);
            }
            EXPECT_EQ(ds->GetRasterXSize(), width);
            EXPECT_EQ(ds->GetRasterYSize(), height);
            for (int i = 0; i < 6; ++i)
                EXPECT_DOUBLE_EQ(geo[i], first_geo[i]);
            ASSERT_NE(ds->GetSpatialRef(), nullptr);
            EXPECT_STREQ(ds->GetSpatialRef()->GetAuthorityCode(nullptr), "32632");
        }
        Dataset vis = Open(scene->GetVisIdxFilename());
        visibility.push_back(ReadBytes(*vis));
        // Each oblique image has ground hidden behind the buildings.
        const auto hidden = std::count(visibility.back().begin(), visibility.back().end(), kHidden);
        EXPECT_GT(hidden, 50) << "hidden pixels";
        EXPECT_TRUE(Open(dir.File("out/" + name + "_vis.png")));
    }

    // The mosaic takes every pixel that some image sees from an image that sees it.
    Dataset mosaic = Open(dir.File("out/mosaic.tif"));
    Dataset source = Open(dir.File("out/mosaic_source.tif"));
    ASSERT_TRUE(mosaic && source);
    EXPECT_EQ(mosaic->GetRasterXSize(), width);
    const std::vector<unsigned char> from = ReadBytes(*source);
    std::size_t unfilled = 0, wrong = 0;
    for (std::size_t i = 0; i < from.size(); ++i) {
        bool seen = false;
        for (const auto& vis : visibility)
            seen = seen || vis[i] == kSeen;
        if (seen && from[i] == 0)
            ++unfilled;
        if (from[i] != 0 && (from[i] > visibility.size() || visibility[from[i] - 1][i] != kSeen))
            ++wrong;
    }
    EXPECT_EQ(unfilled, 0u);
    EXPECT_EQ(wrong, 0u);
    EXPECT_TRUE(Open(dir.File("out/mosaic.png")));

    // The footprints: one layer per scene, named after it, one polygon each.
    Dataset footprints = Open(dir.File("out/footprints.gpkg"), GDAL_OF_VECTOR);
    ASSERT_TRUE(footprints);
    ASSERT_EQ(footprints->GetLayerCount(), static_cast<int>(names.size()));
    for (const std::string& name : names) {
        OGRLayer* layer = footprints->GetLayerByName(name.c_str());
        ASSERT_NE(layer, nullptr) << name;
        EXPECT_EQ(layer->GetFeatureCount(), 1);
        ASSERT_NE(layer->GetSpatialRef(), nullptr);
        EXPECT_STREQ(layer->GetSpatialRef()->GetAuthorityCode(nullptr), "32632");
    }

    // Started again, it finds everything done and touches nothing.
    const auto before = ModifiedTimes(dir.Path() / "out");
    const Result again = Ortho(args, dir);
    EXPECT_EQ(again.status, 0) << again.err;
    EXPECT_EQ(ModifiedTimes(dir.Path() / "out"), before);
    const std::string rerun = ReadFile(dir.File("out/summary.json"));
    EXPECT_EQ(rerun.find("\"status\": \"done\""), std::string::npos) << rerun;
    EXPECT_NE(rerun.find("\"status\": \"complete\""), std::string::npos);
}

// The sample's images run through their cameras twice: found beside each image (camera side
// files), and handed to every scene from the sample's exterior-orientation table (--cameras).
// The orthos agree; a table without a scene's image fails that scene naming both.
TEST(Workflow, CamerasFromSideFilesOrFromATable) {
    TempDir dir;
    const Result made = RunProgram(SILVAN_MAKE_SAMPLE_EXE,
                                   {dir.File("sample"), "--image-size", "128", "--quiet"}, dir);
    ASSERT_EQ(made.status, 0) << made.err;
    const std::vector<std::string> common = {"--dem",        dir.File("sample/dsm.tif"),
                                             "--elevref",    "ELLIPS",
                                             "--pixel-size", "1",
                                             "--quiet"};
    const auto run = [&](const std::string& out, std::vector<std::string> extra) {
        std::vector<std::string> args = {dir.File("sample/master.txt"), "--out", dir.File(out)};
        args.insert(args.end(), common.begin(), common.end());
        args.insert(args.end(), extra.begin(), extra.end());
        return Ortho(args, dir);
    };
    const Result side = run("side", {});
    ASSERT_EQ(side.status, 0) << side.err;
    const Result table = run("table", {"--cameras", dir.File("sample/cameras.txt"),
                                       "--cameras-srs", "EPSG:32632"});
    ASSERT_EQ(table.status, 0) << table.err;
    for (const char* name : {"north", "east", "south", "west"}) {
        Dataset a = Open(dir.File(std::string("side/") + name + "_ortho.tif"), GDAL_OF_RASTER);
        Dataset b = Open(dir.File(std::string("table/") + name + "_ortho.tif"), GDAL_OF_RASTER);
        ASSERT_TRUE(a && b) << name;
        const int w = a->GetRasterXSize(), h = a->GetRasterYSize();
        ASSERT_EQ(w, b->GetRasterXSize());
        ASSERT_EQ(h, b->GetRasterYSize());
        std::vector<double> va(static_cast<size_t>(w) * h), vb(va.size());
        for (int band = 1; band <= 3; ++band) {
            ASSERT_EQ(a->GetRasterBand(band)->RasterIO(GF_Read, 0, 0, w, h, va.data(), w, h,
                                                       GDT_Float64, 0, 0, nullptr),
                      CE_None);
            ASSERT_EQ(b->GetRasterBand(band)->RasterIO(GF_Read, 0, 0, w, h, vb.data(), w, h,
                                                       GDT_Float64, 0, 0, nullptr),
                      CE_None);
            for (size_t i = 0; i < va.size(); ++i)
                ASSERT_LE(std::fabs(va[i] - vb[i]), 1.0) << name << " band " << band << " " << i;
        }
    }
    // The table loses its first row (after the comment line).
    std::string rows = ReadFile(dir.File("sample/cameras.txt"));
    const size_t first = rows.find('\n') + 1;
    rows.erase(first, rows.find('\n', first) + 1 - first);
    WriteFile(dir.File("sample/cameras.txt"), rows);
    const Result missing = run("missing", {"--cameras", dir.File("sample/cameras.txt"),
                                           "--cameras-srs", "EPSG:32632", "--keep-going"});
    EXPECT_EQ(missing.status, 1);
    const std::string summary = ReadFile(dir.File("missing/summary.json")) + missing.err;
    EXPECT_NE(summary.find("no orientation of the image"), std::string::npos) << summary;
    EXPECT_NE(summary.find("north.tif"), std::string::npos) << summary;
}
#endif
#endif

}  // namespace
