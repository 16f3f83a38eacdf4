// The workflow command, run as a user runs it: command line, derived files, errors that name
// the master line, outputs that never replace inputs, summary. With the sample builder and the
// whole chain: the workflow end to end on a reduced sample city, reruns that make again exactly
// what changed, interrupts and the run's lock.
#include "program.h"
#include "rasterread.h"

#include <cpl_json.h>
#include <cpl_string.h>
#include <gdal_alg.h>
#include <gdal_priv.h>
#include <ogrsf_frmts.h>

#include <silvan/silvan.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <tuple>

#ifndef _WIN32
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <unistd.h>
#endif

namespace {

using testsupport::ReadBand;
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

// A master file whose second data line (line 4 of the file) has a bad channel list, whose third
// repeats the first one's name and whose fourth names a missing image: the run stops at the
// first, naming the master file and line; with --keep-going all are listed in the summary, with
// one line numbering whatever ends the lines, and the summary is UTF-8 even for a name that is
// not.
TEST(WorkflowCommand, BadMasterLinesNameFileAndLine) {
    TempDir dir;
    const std::vector<std::string> lines = {"!MFILE master",
                                            "a.tif;1,2,3;0;;0;0;LOW;1;FILL",
                                            "",
                                            "b.tif;1,x;0;;0;0;HIGH;2;FILL",
                                            "a.tif;1;0;;0;0;;0;PREP",
                                            "c.tif;1;0;;0;0;;0;FILL",
                                            "caf\xE9.tif;1;0;;0;0;;0;FILL"};
    const std::string dem = WriteFile(dir.File("dsm.tif"), "");
    for (const std::string eol : {"\n", "\r\n", "\r"}) {
        SCOPED_TRACE(eol == "\r" ? "CR" : eol == "\n" ? "LF" : "CR LF");
        std::string text;
        for (const std::string& line : lines)
            text += line + eol;
        const std::string master = WriteFile(dir.File("master.txt"), text);
        const Result stop = Ortho({master, "--out", dir.File("out"), "--dem", dem}, dir);
        EXPECT_EQ(stop.status, 1);
        EXPECT_NE(stop.err.find("master.txt, line 4, column 1: \"x\" is not an integer"),
                  std::string::npos)
            << stop.err;

        // The derived files hold the master file's columns.
        EXPECT_EQ(ReadFile(dir.File("out/prep.txt")),
                  "!MFILE created for VARNOK\na.tif;1,2,3;0;;0;0\nb.tif;1,x;0;;0;0\n"
                  "a.tif;1;0;;0;0\nc.tif;1;0;;0;0\ncaf\xE9.tif;1;0;;0;0\n");
        EXPECT_EQ(ReadFile(dir.File("out/imgset.txt")),
                  "!IMGSET created for MELDRA\na.tif;LOW;1\nb.tif;HIGH;2\nc.tif;;0\n"
                  "caf\xE9.tif;;0\n");

        const Result going =
            Ortho({master, "--out", dir.File("out"), "--dem", dem, "--keep-going", "-q"}, dir);
        EXPECT_EQ(going.status, 1);
        const std::string summary = ReadFile(dir.File("out/summary.json"));
        EXPECT_TRUE(CPLIsUTF8(summary.c_str(), static_cast<int>(summary.size())));
        CPLJSONDocument json;
        ASSERT_TRUE(json.LoadMemory(summary)) << summary;
        const CPLJSONArray scenes = json.GetRoot().GetArray("scenes");
        ASSERT_EQ(scenes.Size(), 5);
        const struct {
            int master_line;
            std::string error;
        } expected[] = {
            {2, "master.txt, line 2: " + dir.File("a.tif") + ": not found"},
            {4, "master.txt, line 4, column 1"},
            // Its outputs would overwrite the first line's.
            {5, "master.txt, line 5: the scene name \"a\" is already taken by line 2"},
            {6, "master.txt, line 6: " + dir.File("c.tif") + ": not found"},
            {7, "master.txt, line 7: "},
        };
        for (int i = 0; i < 5; ++i) {
            EXPECT_EQ(scenes[i].GetInteger("line"), i);
            EXPECT_EQ(scenes[i].GetInteger("master_line"), expected[i].master_line);
            EXPECT_NE(scenes[i].GetString("error").find(expected[i].error), std::string::npos)
                << scenes[i].GetString("error");
        }
        // A byte that is not UTF-8 is escaped so that it can be had back.
        EXPECT_NE(summary.find("\"source\": \"caf\\udce9.tif\""), std::string::npos) << summary;
        // A failed run lists its failures.
        EXPECT_GE(json.GetRoot().GetArray("errors").Size(), 5);
    }
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

// A one-pixel GeoTIFF, for the inputs whose side files GDAL lists.
void WriteTinyRaster(const std::string& path) {
    GDALAllRegister();
    GDALDriver* driver = GetGDALDriverManager()->GetDriverByName("GTiff");
    GDALClose(driver->Create(path.c_str(), 1, 1, 1, GDT_Byte, nullptr));
}

// Runs whose outputs, or their temporary files, would fall on an input or on each other are
// refused before any work, naming both; names that only look alike work.
TEST(WorkflowCommand, OutputsNeverReplaceInputs) {
    const struct {
        std::vector<std::string> lines;  // of the master file; OUT stands for the output directory
        std::string masterName;          // relative to the test's directory
        std::string dem;
        std::string message;  // empty: no refusal
    } cases[] = {
        {{"a.tif"}, "out/prep.txt", "dsm.tif",
         "out/prep.txt: the preparation file would be written over the master file"},
        {{"a.tif"}, "master.txt", "out/mosaic.tif",
         "out/mosaic.tif: the mosaic would be written over the surface model"},
        {{"OUT/a_ortho.tif", "a.tif"}, "master.txt", "dsm.tif",
         "out/a_ortho.tif: the ortho of MASTER, line 2 would be written over the source image "
         "of MASTER, line 1"},
        // GDAL lists the raster's auxiliary file beside it.
        {{"OUT/b.tif", "b.tif.aux.tif"}, "master.txt", "dsm.tif",
         "out/b.tif.aux.xml: the scene description of MASTER, line 2 would be written over a "
         "side file of the source of MASTER, line 1"},
        // "a.xml.part" is a's temporary description, never "a.part"'s description.
        {{"a.tif", "a.part.tif", "a_ortho.part.tif"}, "master.txt", "dsm.tif", ""},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.message);
        TempDir dir;
        std::filesystem::create_directories(dir.Path() / "out");
        WriteTinyRaster(dir.File("out/b.tif"));
        WriteFile(dir.File("out/b.tif.aux.xml"), "<PAMDataset></PAMDataset>\n");
        WriteFile(dir.File(c.dem), "surface");
        std::string text;
        for (std::string line : c.lines) {
            if (line.rfind("OUT/", 0) == 0)
                line = dir.File("out/" + line.substr(4));
            text += line + ";1;0;;0;0;;0;FILL\n";
        }
        const std::string master = WriteFile(dir.File(c.masterName), text);
        const Result r = Ortho(
            {master, "--out", dir.File("out"), "--dem", dir.File(c.dem), "--keep-going"}, dir);
        EXPECT_EQ(r.status, 1);
        if (c.message.empty()) {
            EXPECT_EQ(r.err.find("would be written"), std::string::npos) << r.err;
            EXPECT_NE(r.err.find("a.part.tif: not found"), std::string::npos) << r.err;
            continue;
        }
        std::string message = dir.File(c.message);
        for (std::size_t at; (at = message.find("MASTER")) != std::string::npos;)
            message.replace(at, 6, master);
        EXPECT_NE(r.err.find(message), std::string::npos) << r.err;
        // Nothing was written: the inputs are as they were, no derived file, no summary.
        EXPECT_EQ(ReadFile(master), text);
        EXPECT_EQ(ReadFile(dir.File(c.dem)), "surface");
        EXPECT_NE(ReadFile(dir.File("out/b.tif.aux.xml")).find("PAMDataset"), std::string::npos);
        if (c.masterName != "out/prep.txt") {
            EXPECT_FALSE(std::filesystem::exists(dir.File("out/prep.txt")));
        }
    }
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

std::vector<unsigned char> ReadBytes(GDALDataset& dataset, int band = 1) {
    const int w = dataset.GetRasterXSize(), h = dataset.GetRasterYSize();
    std::vector<unsigned char> values(static_cast<std::size_t>(w) * h);
    EXPECT_EQ(dataset.GetRasterBand(band)->RasterIO(GF_Read, 0, 0, w, h, values.data(), w, h, GDT_Byte,
                                                 0, 0, nullptr),
              CE_None);
    return values;
}

std::map<std::string, double> ModifiedTimes(const std::filesystem::path& dir) {
    std::map<std::string, double> times;
    for (const auto& entry : std::filesystem::directory_iterator(dir)) {
        // The summary and the lock say what the last run did and who it was.
        const std::string name = entry.path().filename().string();
        if (name.rfind("summary", 0) == 0 || name == ".silvan-ortho.lock")
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
// The reduced sample city in dir/sample, and the arguments of a run on it into dir/out.
std::vector<std::string> MakeSample(const TempDir& dir) {
    const Result made = RunProgram(SILVAN_MAKE_SAMPLE_EXE,
                                   {dir.File("sample"), "--image-size", "192", "--quiet"}, dir);
    EXPECT_EQ(made.status, 0) << made.err;
    return {dir.File("sample/master.txt"), "--out", dir.File("out"), "--dem",
            dir.File("sample/dsm.tif"), "--elevref", "ELLIPS", "--srs", "EPSG:32632",
            "--pixel-size", "1", "--proc", "CPU:1", "--quiet"};
}

TEST(Workflow, SampleCityEndToEnd) {
    TempDir dir;
    std::vector<std::string> args = MakeSample(dir);
    // Blocks small enough for the sample's mosaic to have overviews (an option of the mosaic's
    // driver alone), a compression that the orthos take too, and blocks of the orthos (options
    // of their driver alone).
    args.insert(args.end(), {"--jobs", "2", "--co", "BLOCKSIZE=128", "--co", "COMPRESS=LZW",
                             "--co", "BLOCKXSIZE=64", "--co", "BLOCKYSIZE=64"});
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

    // The mosaic's grid: whole blocks of 16, the CRS and pixel size asked for.
    Dataset mosaic = Open(dir.File("out/mosaic.tif"));
    Dataset source = Open(dir.File("out/mosaic_source.tif"));
    ASSERT_TRUE(mosaic && source);
    double grid[6] = {0};
    ASSERT_EQ(mosaic->GetGeoTransform(grid), CE_None);
    const int width = mosaic->GetRasterXSize(), height = mosaic->GetRasterYSize();
    EXPECT_EQ(width % 16, 0);
    EXPECT_EQ(height % 16, 0);
    EXPECT_DOUBLE_EQ(grid[1], 1.0);

    // Each scene's ortho and visibility index on its own window of that grid: whole pixels
    // from its origin, inside it, and no larger than the footprint's bounding box and a block.
    struct Window {
        int column = 0, row = 0, width = 0, height = 0;
        std::vector<unsigned char> visibility;
        unsigned char at(int x, int y) const {
            x -= column, y -= row;
            return x < 0 || y < 0 || x >= width || y >= height
                       ? 0
                       : visibility[static_cast<std::size_t>(y) * width + x];
        }
    };
    std::vector<Window> windows;
    for (const std::string& name : names) {
        SCOPED_TRACE(name);
        const std::string xml = dir.File("out/" + name + ".xml");
        std::unique_ptr<kestrel::processes::silvan::TOSceneParser> scene(
            kestrel::processes::silvan::ParserFactory::CreateSceneParser(xml));
        EXPECT_EQ(scene->GetOrthoFilename(), dir.File("out/" + name + "_ortho.tif"));
        const auto* footprint = scene->GetSceneFootprint();
        ASSERT_NE(footprint, nullptr);
        EXPECT_GE(footprint->numPoints, 4u);
        if (std::system("xmllint --version > /dev/null 2>&1") == 0) {
            EXPECT_EQ(std::system(("xmllint --valid --noout \"" + xml + "\"").c_str()), 0);
        }
        double minX = 1e300, maxX = -1e300, minY = 1e300, maxY = -1e300;
        for (unsigned int i = 0; i < footprint->numPoints; ++i) {
            minX = std::min(minX, footprint->points[i].x), maxX = std::max(maxX, footprint->points[i].x);
            minY = std::min(minY, footprint->points[i].y), maxY = std::max(maxY, footprint->points[i].y);
        }
        Window window;
        for (const std::string& raster : {scene->GetOrthoFilename(), scene->GetVisIdxFilename()}) {
            Dataset ds = Open(raster);
            ASSERT_TRUE(ds) << raster;
            double geo[6] = {0};
            ASSERT_EQ(ds->GetGeoTransform(geo), CE_None);
            const double column = (geo[0] - grid[0]) / grid[1], row = (geo[3] - grid[3]) / grid[5];
            EXPECT_NEAR(column, std::round(column), 1e-6);
            EXPECT_NEAR(row, std::round(row), 1e-6);
            EXPECT_DOUBLE_EQ(geo[1], grid[1]);
            EXPECT_DOUBLE_EQ(geo[5], grid[5]);
            window.column = static_cast<int>(std::lround(column));
            window.row = static_cast<int>(std::lround(row));
            window.width = ds->GetRasterXSize(), window.height = ds->GetRasterYSize();
            EXPECT_GE(window.column, 0);
            EXPECT_GE(window.row, 0);
            EXPECT_LE(window.column + window.width, width);
            EXPECT_LE(window.row + window.height, height);
            EXPECT_LE(window.width, (maxX - minX) / grid[1] + 16);
            EXPECT_LE(window.height, (maxY - minY) / grid[1] + 16);
            ASSERT_NE(ds->GetSpatialRef(), nullptr);
            EXPECT_STREQ(ds->GetSpatialRef()->GetAuthorityCode(nullptr), "32632");
        }
        Dataset vis = Open(scene->GetVisIdxFilename());
        window.visibility = ReadBytes(*vis);
        // Each oblique image has ground hidden behind the buildings.
        const auto hidden = std::count(window.visibility.begin(), window.visibility.end(), kHidden);
        EXPECT_GT(hidden, 50) << "hidden pixels";
        EXPECT_TRUE(Open(dir.File("out/" + name + "_vis.png")));
        windows.push_back(std::move(window));
    }

    // The mosaic takes every pixel that some image sees from an image that sees it.
    const std::vector<unsigned char> from = ReadBytes(*source);
    std::size_t unfilled = 0, wrong = 0;
    for (int y = 0; y < height; ++y) {
        for (int x = 0; x < width; ++x) {
            const unsigned char k = from[static_cast<std::size_t>(y) * width + x];
            bool seen = false;
            for (const Window& window : windows)
                seen = seen || window.at(x, y) == kSeen;
            if (seen && k == 0)
                ++unfilled;
            if (k != 0 && (k > windows.size() || windows[k - 1].at(x, y) != kSeen))
                ++wrong;
        }
    }
    EXPECT_EQ(unfilled, 0u);
    EXPECT_EQ(wrong, 0u);
    // Its picture (the mosaic's size here, drawn in strips of rows): transparent exactly where
    // the mosaic is empty, grey where the mosaic is, and stretched over 1 to 255.
    Dataset drawing = Open(dir.File("out/mosaic.png"));
    ASSERT_TRUE(drawing);
    ASSERT_EQ(drawing->GetRasterXSize(), width);
    ASSERT_EQ(drawing->GetRasterYSize(), height);
    ASSERT_GT(height, 64);  // more than one strip of rows
    std::vector<std::vector<unsigned char>> drawn, values;
    for (int b = 1; b <= 4; ++b)
        drawn.push_back(ReadBytes(*drawing, b));
    for (int b = 1; b <= 3; ++b)
        values.push_back(ReadBytes(*mosaic, b));
    std::size_t misplaced = 0, tinted = 0;
    unsigned char darkest = 255, brightest = 0;
    for (std::size_t p = 0; p < from.size(); ++p) {
        misplaced += (drawn[3][p] == 0) != (from[p] == 0);
        if (from[p] == 0)
            continue;
        tinted += values[0][p] == values[1][p] && values[1][p] == values[2][p] &&
                  !(drawn[0][p] == drawn[1][p] && drawn[1][p] == drawn[2][p]);
        darkest = std::min(darkest, drawn[0][p]), brightest = std::max(brightest, drawn[0][p]);
    }
    EXPECT_EQ(misplaced, 0u);
    EXPECT_EQ(tinted, 0u);
    EXPECT_EQ(darkest, 1);
    EXPECT_EQ(brightest, 255);
    // A deliverable: a Cloud Optimized GeoTIFF, compressed, with overviews and a mask where no
    // image sees the ground rather than a no-data colour.
    const Result info = RunProgram("gdalinfo", {dir.File("out/mosaic.tif")}, dir);
    for (const char* shown : {"LAYOUT=COG", "COMPRESSION=LZW", "Block=128x128", "Overviews: ",
                              "Mask Flags: PER_DATASET"})
        EXPECT_NE(info.out.find(shown), std::string::npos) << shown << "\n" << info.out;
    EXPECT_EQ(info.out.find("NoData Value"), std::string::npos) << info.out;
    // The orthos take the --co their driver knows; the visibility index keeps its own lossless
    // options, without a predictor (slow to undo on one Byte band).
    for (const auto& [raster, shown, absent] :
         {std::tuple<std::string, std::string, std::string>{"north_ortho.tif", "COMPRESSION=LZW",
                                                            "Block=128x128"},
          {"north_ortho.tif", "Block=64x64", "COMPRESSION=DEFLATE"},
          {"north_vis.tif", "COMPRESSION=DEFLATE", "PREDICTOR="}}) {
        const Result scene = RunProgram("gdalinfo", {dir.File("out/" + raster)}, dir);
        EXPECT_NE(scene.out.find(shown), std::string::npos) << scene.out;
        EXPECT_EQ(scene.out.find(absent), std::string::npos) << scene.out;
    }
    // Quicklooks lie where their rasters do (world files); the source raster's has a legend,
    // beside it and in the summary, whose value k names scene k.
    double mosaicGeo[6] = {0}, pictureGeo[6] = {0};
    Dataset picture = Open(dir.File("out/mosaic_source.png"));
    ASSERT_TRUE(picture);
    ASSERT_EQ(mosaic->GetGeoTransform(mosaicGeo), CE_None);
    ASSERT_EQ(picture->GetGeoTransform(pictureGeo), CE_None);
    EXPECT_DOUBLE_EQ(pictureGeo[0], mosaicGeo[0]);
    EXPECT_DOUBLE_EQ(pictureGeo[3], mosaicGeo[3]);
    EXPECT_NEAR(pictureGeo[1] * picture->GetRasterXSize(), mosaicGeo[1] * width, 1e-6);
    CPLJSONDocument legendFile, summaryFile;
    ASSERT_TRUE(legendFile.Load(dir.File("out/mosaic_source_legend.json")));
    ASSERT_TRUE(summaryFile.Load(dir.File("out/summary.json")));
    const CPLJSONArray legend = legendFile.GetRoot().ToArray();
    EXPECT_EQ(summaryFile.GetRoot().GetArray("mosaic_legend").Format(CPLJSONObject::PrettyFormat::Plain),
              legend.Format(CPLJSONObject::PrettyFormat::Plain));
    ASSERT_EQ(legend.Size(), static_cast<int>(names.size()) + 1);
    for (int k = 1; k < legend.Size(); ++k) {
        EXPECT_EQ(legend[k].GetInteger("value"), k);
        EXPECT_EQ(legend[k].GetString("scene"), names[k - 1]);
        EXPECT_EQ(legend[k].GetString("colour").size(), 7u);
    }
    // Each pixel of the picture has its value's legend colour, and none where no image sees.
    const GDALColorTable* palette = picture->GetRasterBand(1)->GetColorTable();
    ASSERT_NE(palette, nullptr);
    const std::vector<unsigned char> indexes = ReadBytes(*picture);
    ASSERT_EQ(indexes.size(), from.size());
    std::size_t miscoloured = 0;
    for (std::size_t p = 0; p < from.size(); ++p) {
        const GDALColorEntry* e = palette->GetColorEntry(indexes[p]);
        char colour[8];
        std::snprintf(colour, sizeof colour, "#%02x%02x%02x", e->c1, e->c2, e->c3);
        miscoloured += from[p] == 0 ? e->c4 != 0
                                    : e->c4 != 255 || legend[from[p]].GetString("colour") != colour;
    }
    EXPECT_EQ(miscoloured, 0u);
    // The balance applied: a gain and an offset per scene and channel, in the scenes' order.
    const CPLJSONObject balance = summaryFile.GetRoot().GetObj("balance");
    EXPECT_EQ(balance.GetString("method"), "gain-offset");
    ASSERT_EQ(balance.GetArray("scenes").Size(), static_cast<int>(names.size()));
    for (int k = 0; k < balance.GetArray("scenes").Size(); ++k) {
        const CPLJSONObject scene = balance.GetArray("scenes")[k];
        EXPECT_EQ(scene.GetString("scene"), names[k]);
        EXPECT_EQ(scene.GetArray("gain").Size(), 3);
        EXPECT_EQ(scene.GetArray("offset").Size(), 3);
    }

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

    // Started again, it finds everything done and touches nothing; its log counts the
    // surface's holes under the grid.
    const auto before = ModifiedTimes(dir.Path() / "out");
    args.erase(std::find(args.begin(), args.end(), "--quiet"));
    const Result again = Ortho(args, dir);
    EXPECT_EQ(again.status, 0) << again.err;
    EXPECT_NE((again.out + again.err).find("posts under the output grid (0.00 %) have no height"),
              std::string::npos)
        << again.out << again.err;
    EXPECT_EQ(ModifiedTimes(dir.Path() / "out"), before);
    const std::string rerun = ReadFile(dir.File("out/summary.json"));
    EXPECT_EQ(rerun.find("\"status\": \"done\""), std::string::npos) << rerun;
    EXPECT_NE(rerun.find("\"status\": \"complete\""), std::string::npos);
    // The kept mosaic's balance is still reported.
    CPLJSONDocument kept;
    ASSERT_TRUE(kept.Load(dir.File("out/summary.json")));
    EXPECT_EQ(kept.GetRoot().GetObj("balance").Format(CPLJSONObject::PrettyFormat::Plain),
              balance.Format(CPLJSONObject::PrettyFormat::Plain));
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
    for (const char* name : {"north", "east", "south", "west"})
        for (int band = 1; band <= 3; ++band) {
            const std::string ortho = std::string("/") + name + "_ortho.tif";
            const std::vector<double> a = ReadBand(dir.File("side" + ortho), band);
            const std::vector<double> b = ReadBand(dir.File("table" + ortho), band);
            ASSERT_TRUE(!a.empty() && a.size() == b.size()) << name;
            for (size_t i = 0; i < a.size(); ++i)
                ASSERT_LE(std::fabs(a[i] - b[i]), 1.0) << name << " band " << band << " " << i;
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

// Each scene's status and reason in a run's summary, by scene name.
std::map<std::string, std::pair<std::string, std::string>> SceneStates(const TempDir& dir) {
    CPLJSONDocument summary;
    EXPECT_TRUE(summary.Load(dir.File("out/summary.json")));
    std::map<std::string, std::pair<std::string, std::string>> states;
    for (const CPLJSONObject& scene : summary.GetRoot().GetArray("scenes")) {
        states[std::filesystem::path(scene.GetString("source")).stem().string()] = {
            scene.GetString("status"), scene.GetString("reason")};
    }
    return states;
}

void ReplaceInFile(const std::string& path, const std::string& from, const std::string& to) {
    std::string text = ReadFile(path);
    const auto at = text.find(from);
    ASSERT_NE(at, std::string::npos) << from;
    WriteFile(path, text.replace(at, from.size(), to));
}

// A surface model that covers only the middle of the images: orthos of the covered ground, and
// one warning line per scene saying what share of its ground the surface leaves out, also when
// a rerun finds the grid worked out.
TEST(Workflow, SurfaceOverPartOfTheImagesMakesOrthosOfTheCoveredGround) {
    TempDir dir;
    std::vector<std::string> args = MakeSample(dir);
    const Result cut = RunProgram("gdal_translate", {"-q", "-srcwin", "160", "160", "160", "160",
                                                     dir.File("sample/dsm.tif"),
                                                     dir.File("sample/middle.tif")},
                                  dir);
    ASSERT_EQ(cut.status, 0) << cut.err;
    std::replace(args.begin(), args.end(), dir.File("sample/dsm.tif"),
                 dir.File("sample/middle.tif"));
    args.erase(std::remove(args.begin(), args.end(), std::string("--quiet")), args.end());
    for (const char* run : {"first", "rerun"}) {
        SCOPED_TRACE(run);
        const Result result = Ortho(args, dir);
        ASSERT_EQ(result.status, 0) << result.err;
        std::size_t warnings = 0;
        for (std::size_t at = result.err.find("the surface model leaves out");
             at != std::string::npos; at = result.err.find("the surface model leaves out", at + 1))
            ++warnings;
        EXPECT_EQ(warnings, SceneStates(dir).size()) << result.err;
    }
    Dataset middle = Open(dir.File("sample/middle.tif"));
    Dataset mosaic = Open(dir.File("out/mosaic.tif"));
    ASSERT_TRUE(middle && mosaic);
    // The grid is the covered ground's, in whole blocks of 16 pixels.
    EXPECT_LE(mosaic->GetRasterXSize(), middle->GetRasterXSize() + 32);
    EXPECT_LE(mosaic->GetRasterYSize(), middle->GetRasterYSize() + 32);
}

// The two rasters have the same size and geotransform (within tolerance).
void ExpectSameGrid(const std::string& path, const std::string& reference, double tolerance) {
    Dataset a = Open(path), b = Open(reference);
    ASSERT_TRUE(a && b);
    EXPECT_EQ(a->GetRasterXSize(), b->GetRasterXSize());
    EXPECT_EQ(a->GetRasterYSize(), b->GetRasterYSize());
    double ga[6], gb[6];
    ASSERT_EQ(a->GetGeoTransform(ga), CE_None);
    ASSERT_EQ(b->GetGeoTransform(gb), CE_None);
    for (int i = 0; i < 6; ++i)
        EXPECT_NEAR(ga[i], gb[i], tolerance) << i;
}

// --te and --tr: the mosaic holds exactly the cells gdalwarp -te -tr makes (not whole blocks,
// pixels not square, corners not on multiples of the pixel size); scenes whose footprint does
// not reach the area are skipped and listed so, also when a rerun keeps everything.
TEST(Workflow, AreaOfInterestIsTheGridGdalwarpMakes) {
    TempDir dir;
    std::vector<std::string> args = MakeSample(dir);
    const auto size = std::find(args.begin(), args.end(), std::string("--pixel-size"));
    args.erase(size, size + 2);
    const std::vector<std::string> plain = args;
    const std::vector<std::string> area = {"514900", "5033975.5", "514950.5", "5033990"};
    args.insert(args.end(), {"--tr", "1.5", "1", "--te"});
    args.insert(args.end(), area.begin(), area.end());
    for (const char* run : {"first", "rerun"}) {
        SCOPED_TRACE(run);
        const Result result = Ortho(args, dir);
        ASSERT_EQ(result.status, 0) << result.err;
        const auto states = SceneStates(dir);
        const std::string made = std::string(run) == "first" ? "done" : "complete";
        EXPECT_EQ(states.at("north").first, made);
        EXPECT_EQ(states.at("south").first, made);
        EXPECT_EQ(states.at("east").first, "outside the area of interest");
        EXPECT_EQ(states.at("west").first, "outside the area of interest");
        EXPECT_FALSE(std::filesystem::exists(dir.File("out/east_ortho.tif")));
    }
    const Result warped = RunProgram("gdalwarp", {"-q", "-te", area[0], area[1], area[2], area[3],
                                                  "-tr", "1.5", "1", dir.File("out/north_ortho.tif"),
                                                  dir.File("warped.tif")},
                                     dir);
    ASSERT_EQ(warped.status, 0) << warped.err;
    ExpectSameGrid(dir.File("out/mosaic.tif"), dir.File("warped.tif"), 0.0);

    // --cutline makes the mosaic again (the scenes are kept): filled where the mosaic without it
    // was and gdalwarp -cutline keeps the cell.
    std::filesystem::copy_file(dir.File("out/mosaic.tif"), dir.File("uncut.tif"));
    const std::string cutline = WriteFile(
        dir.File("cut.geojson"),
        R"({"type": "FeatureCollection", "crs": {"type": "name", "properties": {"name":
        "urn:ogc:def:crs:EPSG::32632"}}, "features": [{"type": "Feature", "properties": {},
        "geometry": {"type": "Polygon", "coordinates": [[[514905, 5033976], [514948, 5033978],
        [514915, 5033989], [514905, 5033976]]]}}]})");
    args.insert(args.end(), {"--cutline", cutline});
    const Result cut = Ortho(args, dir);
    ASSERT_EQ(cut.status, 0) << cut.err;
    EXPECT_EQ(SceneStates(dir).at("north").first, "complete");
    const Result cutWarped =
        RunProgram("gdalwarp", {"-q", "-te", area[0], area[1], area[2], area[3], "-tr", "1.5", "1",
                                "-cutline", cutline, "-dstalpha", dir.File("uncut.tif"),
                                dir.File("cut_warped.tif")},
                   dir);
    ASSERT_EQ(cutWarped.status, 0) << cutWarped.err;
    Dataset mosaic = Open(dir.File("out/mosaic.tif"));
    Dataset reference = Open(dir.File("cut_warped.tif"));
    Dataset uncut = Open(dir.File("uncut.tif"));
    ASSERT_TRUE(mosaic && reference && uncut);
    const auto filled = [](GDALRasterBand& band) {
        std::vector<unsigned char> values(static_cast<std::size_t>(band.GetXSize()) *
                                          band.GetYSize());
        EXPECT_EQ(band.RasterIO(GF_Read, 0, 0, band.GetXSize(), band.GetYSize(), values.data(),
                                band.GetXSize(), band.GetYSize(), GDT_Byte, 0, 0, nullptr),
                  CE_None);
        for (unsigned char& v : values)
            v = v != 0;
        return values;
    };
    const auto kept = filled(*mosaic->GetRasterBand(1)->GetMaskBand());
    auto expected = filled(*reference->GetRasterBand(reference->GetRasterCount()));
    const auto before = filled(*uncut->GetRasterBand(1)->GetMaskBand());
    for (std::size_t i = 0; i < expected.size(); ++i)
        expected[i] = expected[i] && before[i];
    EXPECT_EQ(kept, expected);
    EXPECT_GT(std::count(kept.begin(), kept.end(), 1), 0);
    EXPECT_LT(std::count(kept.begin(), kept.end(), 1), 34 * 15 / 2);

    // --te alone, as gdalwarp -te without -tr: the area exactly, in whole cells of about the
    // source's resolution (that of an ortho made without --te).
    std::vector<std::string> natural = plain, alone = plain;
    natural[2] = dir.File("natural");
    natural.insert(natural.end(), {"--lines", "0:1"});
    alone[2] = dir.File("alone");
    alone.push_back("--te");
    alone.insert(alone.end(), area.begin(), area.end());
    ASSERT_EQ(Ortho(natural, dir).status, 0);
    ASSERT_EQ(Ortho(alone, dir).status, 0);
    std::string ortho;
    for (const auto& entry : std::filesystem::directory_iterator(dir.File("natural"))) {
        if (entry.path().string().find("_ortho.tif") != std::string::npos)
            ortho = entry.path().string();
    }
    const Result warpedAlone = RunProgram(
        "gdalwarp", {"-q", "-te", area[0], area[1], area[2], area[3], ortho, dir.File("alone.tif")},
        dir);
    ASSERT_EQ(warpedAlone.status, 0) << warpedAlone.err;
    ExpectSameGrid(dir.File("alone/mosaic.tif"), dir.File("alone.tif"), 1e-9);

    // A cutline that no scene reaches (here, in another CRS) stops the run, saying so.
    WriteFile(cutline, R"({"type": "FeatureCollection", "features": [{"type": "Feature",
        "properties": {}, "geometry": {"type": "Polygon", "coordinates": [[[9.1, 45.3],
        [9.12, 45.3], [9.1, 45.32], [9.1, 45.3]]]}}]})");
    const Result far = Ortho(args, dir);
    EXPECT_EQ(far.status, 1);
    EXPECT_NE(far.err.find("no scene reaches the area of interest"), std::string::npos) << far.err;
}

// A rerun after each change makes again exactly the scenes (and the mosaic) that the change
// touches, and says why.
TEST(Workflow, RerunMakesAgainWhatChangedAndSaysWhy) {
    TempDir dir;
    std::vector<std::string> args = MakeSample(dir);
    ASSERT_EQ(Ortho(args, dir).status, 0);
    const std::set<std::string> all = {"north", "east", "south", "west"};
    const struct {
        const char* change;
        std::function<void()> make;
        std::set<std::string> madeAgain;
        std::string reason;  // of each scene made again, or else of the mosaic
        bool mosaic;
        bool footprints = true;  // footprints.gpkg merged again (when the mosaic is made)
    } steps[] = {
        {"nothing", [] {}, {}, "", false, false},
        {"the generator's threads, which change no pixel",
         [&] { args.insert(args.end(), {"--proc", "CPU:2"}); }, {}, "", false, false},
        {"a source's time but not its content",
         [&] {
             const auto path = dir.Path() / "sample/north.tif";
             std::filesystem::last_write_time(
                 path, std::filesystem::last_write_time(path) + std::chrono::hours(1));
         },
         {}, "", false, false},
        {"the resampling",
         [&] { args.insert(args.end(), {"--resample", "near"}); },
         all, "--resample changed: bilinear -> near", true},
        {"a source's pixels",
         [&] {
             GDALAllRegister();
             Dataset south(GDALDataset::Open(dir.File("sample/south.tif").c_str(),
                                             GDAL_OF_RASTER | GDAL_OF_UPDATE));
             ASSERT_TRUE(south);
             unsigned char value = 0;
             ASSERT_EQ(south->GetRasterBand(1)->RasterIO(GF_Read, 90, 90, 1, 1, &value, 1, 1,
                                                         GDT_Byte, 0, 0, nullptr),
                       CE_None);
             value = static_cast<unsigned char>(value + 1);
             ASSERT_EQ(south->GetRasterBand(1)->RasterIO(GF_Write, 90, 90, 1, 1, &value, 1, 1,
                                                         GDT_Byte, 0, 0, nullptr),
                       CE_None);
         },
         {"south"}, "source file " + dir.File("sample/south.tif") + " changed", true},
        {"a master line's channels",
         [&] {
             ReplaceInFile(dir.File("sample/master.txt"), "east.tif;1,2,3", "east.tif;3,2,1");
         },
         {"east"}, "master line changed: ", true},
        {"an image-set value, which only the mosaic reads",
         [&] {
             ReplaceInFile(dir.File("sample/master.txt"), "HIGH;1", "HIGH;2");
         },
         {}, "scene west changed", true, false},
        {"the colour balance, which only the mosaic reads",
         [&] { args.insert(args.end(), {"--balance", "none"}); },
         {}, "--balance changed: gain-offset -> none", true, false},
        {"the choice of regions, which only the mosaic reads",
         [&] { args.insert(args.end(), {"--seams", "pixel"}); },
         {}, "--seams changed: lines -> pixel", true, false},
        {"a creation option only the mosaic takes",
         [&] { args.insert(args.end(), {"--co", "LEVEL=6"}); },
         {}, "--co changed: (none) -> LEVEL=6", true, false},
        {"a creation option of the orthos",
         [&] { args.insert(args.end(), {"--co", "BLOCKXSIZE=64", "--co", "BLOCKYSIZE=64"}); },
         all, "--co changed: (none) -> BLOCKXSIZE=64 BLOCKYSIZE=64", true},
        {"seamlines handed back",
         [&] {
             std::filesystem::copy_file(dir.File("out/seamlines.gpkg"), dir.File("seams.gpkg"));
             args.insert(args.end(), {"--seamlines", dir.File("seams.gpkg")});
         },
         {}, "--seamlines changed", true, false},
        {"a seamline polygon given to another scene",
         [&] {
             Dataset seams(GDALDataset::Open(dir.File("seams.gpkg").c_str(),
                                             GDAL_OF_VECTOR | GDAL_OF_UPDATE, nullptr, nullptr));
             ASSERT_TRUE(seams);
             OGRLayer* layer = seams->GetLayerByName("seamlines");
             ASSERT_NE(layer, nullptr);
             std::unique_ptr<OGRFeature> feature(layer->GetNextFeature());
             ASSERT_TRUE(feature);
             feature->SetField("scene", feature->GetFieldAsString("scene") == std::string("north")
                                            ? "south"
                                            : "north");
             ASSERT_EQ(layer->SetFeature(feature.get()), OGRERR_NONE);
         },
         {}, "seamlines file " + dir.File("seams.gpkg") + " changed", true, false},
        {"an area of interest that changes no scene's window",
         [&] { args.insert(args.end(), {"--te", "514848", "5033845", "515008", "5033989"}); },
         {}, "--te changed", true, false},
        {"an area of interest that clips one scene's window",
         [&] { args[args.size() - 2] = "514985"; }, {"west"}, "window changed", true},
        {"a lost output",
         [&] { std::filesystem::remove(dir.Path() / "out/north_vis.png"); },
         {"north"}, dir.File("out/north_vis.png") + " is missing", false, false},
        {"--overwrite", [&] { args.push_back("--overwrite"); }, all, "--overwrite", true},
    };
    for (const auto& step : steps) {
        SCOPED_TRACE(step.change);
        step.make();
        const Result r = Ortho(args, dir);
        ASSERT_EQ(r.status, 0) << r.err;
        std::set<std::string> madeAgain;
        for (const auto& scene : SceneStates(dir)) {
            if (scene.second.first == "done") {
                madeAgain.insert(scene.first);
                EXPECT_NE(scene.second.second.find(step.reason), std::string::npos)
                    << scene.first << ": " << scene.second.second;
            } else {
                EXPECT_EQ(scene.second.first, "complete");
            }
        }
        EXPECT_EQ(madeAgain, step.madeAgain);
        CPLJSONDocument summary;
        ASSERT_TRUE(summary.Load(dir.File("out/summary.json")));
        const std::string mosaicReason = summary.GetRoot().GetString("mosaic_reason");
        EXPECT_EQ(!mosaicReason.empty(), step.mosaic) << mosaicReason;
        EXPECT_EQ(summary.GetRoot().GetObj("timings").GetObj("footprint merge").IsValid(),
                  step.mosaic && step.footprints);
        if (step.madeAgain.empty() && step.mosaic) {
            EXPECT_NE(mosaicReason.find(step.reason), std::string::npos) << mosaicReason;
        }
    }
}

// Pixels of the raster's grid whose centre lies in the shape: 1, else 0.
std::vector<unsigned char> Burnt(GDALDataset& grid, OGRGeometry& shape) {
    GDALDriver* memory = GetGDALDriverManager()->GetDriverByName("MEM");
    Dataset burnt(memory->Create("", grid.GetRasterXSize(), grid.GetRasterYSize(), 1, GDT_Byte,
                                 nullptr));
    double geo[6];
    EXPECT_EQ(grid.GetGeoTransform(geo), CE_None);
    burnt->SetGeoTransform(geo);
    int band = 1;
    double one = 1.0;
    OGRGeometryH handle = OGRGeometry::ToHandle(&shape);
    EXPECT_EQ(GDALRasterizeGeometries(GDALDataset::ToHandle(burnt.get()), 1, &band, 1, &handle,
                                      nullptr, nullptr, &one, nullptr, nullptr, nullptr),
              CE_None);
    return ReadBytes(*burnt);
}

// DIR/seamlines.gpkg against the source raster `source` of the scenes `scenes`: burnt back by
// gdal_rasterize, scene by scene, it is the source raster, and it holds one valid polygon for
// each region (4-connected pixels of one scene).
void ExpectSeamlinesAreTheRegions(const TempDir& dir, const CPLJSONArray& scenes,
                                  const std::vector<unsigned char>& source) {
    const Result blank = RunProgram(
        "gdal_translate", {"-q", "-scale", "0", "255", "0", "0", dir.File("out/mosaic_source.tif"),
                           dir.File("burnt.tif")},
        dir);
    ASSERT_EQ(blank.status, 0) << blank.err;
    for (int k = 1; k <= scenes.Size(); ++k) {
        const Result burn = RunProgram(
            "gdal_rasterize", {"-q", "-l", "seamlines", "-where",
                               "scene = '" + scenes[k - 1].ToString() + "'", "-burn",
                               std::to_string(k), dir.File("out/seamlines.gpkg"),
                               dir.File("burnt.tif")},
            dir);
        ASSERT_EQ(burn.status, 0) << burn.err;
    }
    Dataset burnt = Open(dir.File("burnt.tif"));
    ASSERT_TRUE(burnt);
    EXPECT_EQ(ReadBytes(*burnt), source);
    const int width = burnt->GetRasterXSize(), height = burnt->GetRasterYSize();
    std::vector<int> label(source.size(), -1);
    int regions = 0;
    for (std::size_t start = 0; start < source.size(); ++start) {
        if (source[start] == 0 || label[start] >= 0)
            continue;
        std::vector<std::size_t> stack = {start};
        label[start] = regions;
        while (!stack.empty()) {
            const std::size_t p = stack.back();
            stack.pop_back();
            const int x = static_cast<int>(p % width), y = static_cast<int>(p / width);
            const std::pair<int, int> next[] = {{x - 1, y}, {x + 1, y}, {x, y - 1}, {x, y + 1}};
            for (const auto& [u, v] : next) {
                const std::size_t q = static_cast<std::size_t>(v) * width + u;
                if (u >= 0 && v >= 0 && u < width && v < height && label[q] < 0 &&
                    source[q] == source[p]) {
                    label[q] = regions;
                    stack.push_back(q);
                }
            }
        }
        ++regions;
    }
    Dataset seams = Open(dir.File("out/seamlines.gpkg"), GDAL_OF_VECTOR);
    ASSERT_TRUE(seams);
    OGRLayer* layer = seams->GetLayerByName("seamlines");
    ASSERT_NE(layer, nullptr);
    int features = 0, invalid = 0;
    for (const auto& feature : *layer) {
        ++features;
        invalid += !feature->GetGeometryRef()->IsValid();
    }
    EXPECT_EQ(features, regions);
    EXPECT_EQ(invalid, 0);
}

// DIR/seamlines.gpkg holds the mosaic's regions: burnt back by gdal_rasterize, scene by scene,
// it is the source raster. An edited copy (one vertex of a polygon dragged outward) handed back
// with --seamlines makes the mosaic again, not the scenes, and the mosaic changes only between
// the old and the new edge (its source there) and within the blend band around them.
TEST(Workflow, EditedSeamlinesChangeTheMosaicThereAlone) {
    TempDir dir;
    std::vector<std::string> args = MakeSample(dir);
    constexpr int kBlend = 4;
    args.insert(args.end(), {"--blend-width", std::to_string(kBlend)});
    ASSERT_EQ(Ortho(args, dir).status, 0);
    Dataset source = Open(dir.File("out/mosaic_source.tif"));
    ASSERT_TRUE(source);
    const std::vector<unsigned char> sourceBefore = ReadBytes(*source);
    const int width = source->GetRasterXSize(), height = source->GetRasterYSize();
    CPLJSONDocument summary;
    ASSERT_TRUE(summary.Load(dir.File("out/summary.json")));
    const CPLJSONArray scenes = summary.GetRoot().GetArray("mosaic_scenes");
    EXPECT_EQ(summary.GetRoot().GetObj("balance").GetInteger("blend_width"), kBlend);
    EXPECT_EQ(summary.GetRoot().GetObj("balance").GetArray("scenes").Size(), scenes.Size());

    ExpectSeamlinesAreTheRegions(dir, scenes, sourceBefore);

    // Later features win where polygons overlap: the largest region, dragged last, one vertex
    // moved 6 m (6 pixels) away from its centre into another scene's region.
    std::filesystem::copy_file(dir.File("out/seamlines.gpkg"), dir.File("edited.gpkg"));
    double geo[6];
    ASSERT_EQ(source->GetGeoTransform(geo), CE_None);
    std::vector<unsigned char> between;
    {
        Dataset edited(GDALDataset::Open(dir.File("edited.gpkg").c_str(),
                                         GDAL_OF_VECTOR | GDAL_OF_UPDATE, nullptr, nullptr));
        ASSERT_TRUE(edited);
        OGRLayer* layer = edited->GetLayerByName("seamlines");
        ASSERT_NE(layer, nullptr);
        std::unique_ptr<OGRFeature> largest;
        while (OGRFeature* feature = layer->GetNextFeature()) {
            std::unique_ptr<OGRFeature> owned(feature);
            if (!largest || owned->GetGeometryRef()->toPolygon()->get_Area() >
                                largest->GetGeometryRef()->toPolygon()->get_Area())
                largest = std::move(owned);
        }
        ASSERT_TRUE(largest);
        ASSERT_EQ(layer->DeleteFeature(largest->GetFID()), OGRERR_NONE);
        largest->SetFID(OGRNullFID);
        auto* polygon = dynamic_cast<OGRPolygon*>(largest->GetGeometryRef());
        ASSERT_NE(polygon, nullptr);
        const std::unique_ptr<OGRGeometry> old(polygon->clone());
        OGRPoint centre;
        ASSERT_EQ(polygon->Centroid(&centre), OGRERR_NONE);
        OGRLinearRing* ring = polygon->getExteriorRing();
        bool moved = false;
        for (int i = 1; i + 1 < ring->getNumPoints() && !moved; ++i) {
            const double dx = ring->getX(i) - centre.getX(), dy = ring->getY(i) - centre.getY();
            const double x = ring->getX(i) + 6 * dx / std::hypot(dx, dy);
            const double y = ring->getY(i) + 6 * dy / std::hypot(dx, dy);
            const int u = static_cast<int>(std::floor((x - geo[0]) / geo[1]));
            const int v = static_cast<int>(std::floor((y - geo[3]) / geo[5]));
            // Inside, away from the mosaic's edges.
            if (u < 16 || v < 16 || u + 16 >= width || v + 16 >= height)
                continue;
            const unsigned char there = sourceBefore[static_cast<std::size_t>(v) * width + u];
            if (there == 0 || scenes[there - 1].ToString() == largest->GetFieldAsString("scene"))
                continue;
            ring->setPoint(i, x, y);
            moved = true;
        }
        ASSERT_TRUE(moved);
        ASSERT_EQ(layer->CreateFeature(largest.get()), OGRERR_NONE);
        const std::vector<unsigned char> a = Burnt(*source, *old);
        between = Burnt(*source, *polygon);
        for (std::size_t i = 0; i < between.size(); ++i)
            between[i] = between[i] != a[i];
    }
    ASSERT_GT(std::count(between.begin(), between.end(), 1), 5);
    // The band where blending may change the mosaic: within the blend width of those pixels.
    std::vector<unsigned char> band(between.size(), 0);
    for (int y = 0; y < height; ++y)
        for (int x = 0; x < width; ++x) {
            if (!between[static_cast<std::size_t>(y) * width + x])
                continue;
            for (int v = std::max(0, y - kBlend - 1); v <= std::min(height - 1, y + kBlend + 1); ++v)
                for (int u = std::max(0, x - kBlend - 1); u <= std::min(width - 1, x + kBlend + 1); ++u)
                    band[static_cast<std::size_t>(v) * width + u] = 1;
        }
    source.reset();

    Dataset mosaicBefore = Open(dir.File("out/mosaic.tif"));
    ASSERT_TRUE(mosaicBefore);
    const std::vector<unsigned char> pixelsBefore = ReadBytes(*mosaicBefore);
    mosaicBefore.reset();
    const auto times = ModifiedTimes(dir.Path() / "out");
    args.insert(args.end(), {"--seamlines", dir.File("edited.gpkg")});
    const Result rerun = Ortho(args, dir);
    ASSERT_EQ(rerun.status, 0) << rerun.err;
    for (const auto& scene : SceneStates(dir))
        EXPECT_EQ(scene.second.first, "complete") << scene.first;
    const auto after = ModifiedTimes(dir.Path() / "out");
    for (const auto& file : times) {
        if (file.first.find("mosaic") == std::string::npos && file.first != "seamlines.gpkg" &&
            file.first != "footprints.gpkg") {
            EXPECT_EQ(after.at(file.first), file.second) << file.first;
        }
    }
    ASSERT_TRUE(summary.Load(dir.File("out/summary.json")));
    EXPECT_NE(summary.GetRoot().GetString("mosaic_reason").find("--seamlines changed"),
              std::string::npos);

    source = Open(dir.File("out/mosaic_source.tif"));
    Dataset mosaic = Open(dir.File("out/mosaic.tif"));
    ASSERT_TRUE(source && mosaic);
    const std::vector<unsigned char> sourceAfter = ReadBytes(*source);
    const std::vector<unsigned char> pixelsAfter = ReadBytes(*mosaic);
    std::size_t movedSource = 0, strayedSource = 0, strayedPixels = 0;
    for (std::size_t i = 0; i < sourceAfter.size(); ++i) {
        if (sourceAfter[i] != sourceBefore[i])
            ++(between[i] ? movedSource : strayedSource);
        if (pixelsAfter[i] != pixelsBefore[i] && !band[i])
            ++strayedPixels;
    }
    EXPECT_GT(movedSource, 0u);


    EXPECT_EQ(strayedSource, 0u);
    EXPECT_EQ(strayedPixels, 0u);
}

// Per-pixel regions, and regions drawn as a checkerboard of one scene's pixels in another's:
// holes, and pixels of a scene that touch at a corner alone.
TEST(Workflow, RaggedSeamlinesAreTheRegions) {
    TempDir dir;
    std::vector<std::string> args = MakeSample(dir);
    args.insert(args.end(), {"--seams", "pixel", "--blend-width", "0"});
    ASSERT_EQ(Ortho(args, dir).status, 0);
    CPLJSONDocument summary;
    ASSERT_TRUE(summary.Load(dir.File("out/summary.json")));
    const CPLJSONArray scenes = summary.GetRoot().GetArray("mosaic_scenes");
    ASSERT_GE(scenes.Size(), 2);
    Dataset source = Open(dir.File("out/mosaic_source.tif"));
    ASSERT_TRUE(source);
    ExpectSeamlinesAreTheRegions(dir, scenes, ReadBytes(*source));

    // A square of the first scene, and in its middle every other pixel the second's.
    double geo[6];
    ASSERT_EQ(source->GetGeoTransform(geo), CE_None);
    const int cx = source->GetRasterXSize() / 2, cy = source->GetRasterYSize() / 2;
    {
        Dataset drawn(GetGDALDriverManager()->GetDriverByName("GPKG")->Create(
            dir.File("checkers.gpkg").c_str(), 0, 0, 0, GDT_Unknown, nullptr));
        ASSERT_TRUE(drawn);
        OGRSpatialReference srs(*source->GetSpatialRef());
        OGRLayer* layer = drawn->CreateLayer("seamlines", &srs, wkbPolygon, nullptr);
        ASSERT_NE(layer, nullptr);
        OGRFieldDefn scene("scene", OFTString);
        ASSERT_EQ(layer->CreateField(&scene), OGRERR_NONE);
        auto square = [&](const std::string& name, int x, int y, int size) {
            OGRLinearRing ring;
            for (const auto& [u, v] : {std::pair<int, int>{x, y}, {x + size, y},
                                      {x + size, y + size}, {x, y + size}, {x, y}})
                ring.addPoint(geo[0] + u * geo[1], geo[3] + v * geo[5]);
            OGRPolygon polygon;
            polygon.addRing(&ring);
            OGRFeature feature(layer->GetLayerDefn());
            feature.SetField("scene", name.c_str());
            feature.SetGeometry(&polygon);
            EXPECT_EQ(layer->CreateFeature(&feature), OGRERR_NONE);
        };
        square(scenes[0].ToString(), cx - 12, cy - 12, 24);
        for (int y = cy - 5; y < cy + 5; ++y)
            for (int x = cx - 5 + (y - cy + 5) % 2; x < cx + 5; x += 2)
                square(scenes[1].ToString(), x, y, 1);
    }
    args.insert(args.end(), {"--seamlines", dir.File("checkers.gpkg")});
    ASSERT_EQ(Ortho(args, dir).status, 0);
    source = Open(dir.File("out/mosaic_source.tif"));
    ASSERT_TRUE(source);
    ExpectSeamlinesAreTheRegions(dir, scenes, ReadBytes(*source));
}

// Images of 4 pixels: one scene's footprint has 3 corners. It fails on its own, saying so, and
// the footprints of the others are merged.
TEST(Workflow, FootprintWithTooFewCornersFailsItsSceneAlone) {
    TempDir dir;
    const Result made = RunProgram(SILVAN_MAKE_SAMPLE_EXE,
                                   {dir.File("sample"), "--image-size", "4", "--quiet"}, dir);
    ASSERT_EQ(made.status, 0) << made.err;
    const Result r = Ortho({dir.File("sample/master.txt"), "--out", dir.File("out"), "--dem",
                            dir.File("sample/dsm.tif"), "--elevref", "ELLIPS", "--srs",
                            "EPSG:32632", "--proc", "CPU:1", "--keep-going", "--quiet"},
                           dir);
    EXPECT_EQ(r.status, 1);
    EXPECT_NE(r.err.find("east.tif: the footprint has 3 corner(s); a scene's footprint needs at "
                         "least 4"),
              std::string::npos)
        << r.err;
    const auto states = SceneStates(dir);
    EXPECT_EQ(states.at("east").first, "failed");
    EXPECT_EQ(states.at("south").first, "done");
    Dataset footprints = Open(dir.File("out/footprints.gpkg"), GDAL_OF_VECTOR);
    ASSERT_TRUE(footprints);
    EXPECT_NE(footprints->GetLayerByName("south"), nullptr);
    EXPECT_EQ(footprints->GetLayerByName("east"), nullptr);
}

#ifndef _WIN32
// A run in the background, its output in files of dir.
pid_t Start(const std::vector<std::string>& args, const TempDir& dir) {
    std::vector<std::string> argv = {kOrtho};
    argv.insert(argv.end(), args.begin(), args.end());
    std::vector<char*> pointers;
    for (std::string& arg : argv)
        pointers.push_back(arg.data());
    pointers.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 2, dir.File("background.txt").c_str(),
                                     O_WRONLY | O_CREAT | O_TRUNC, 0644);
    pid_t pid = -1;
    EXPECT_EQ(posix_spawn(&pid, kOrtho.c_str(), &actions, nullptr, pointers.data(), environ), 0);
    posix_spawn_file_actions_destroy(&actions);
    return pid;
}

std::vector<std::string> TemporaryFiles(const std::filesystem::path& dir) {
    std::vector<std::string> parts;
    for (const auto& entry : std::filesystem::directory_iterator(dir)) {
        if (entry.path().filename().string().find(".part") != std::string::npos)
            parts.push_back(entry.path().filename().string());
    }
    return parts;
}

// Waits until the run has started on a scene's ortho; false when it ended first.
bool AtWork(pid_t pid, const TempDir& dir) {
    for (;;) {
        std::error_code ec;
        for (const auto& entry : std::filesystem::directory_iterator(dir.Path() / "out", ec)) {
            if (entry.path().filename().string().find("_ortho.part.") != std::string::npos)
                return true;
        }
        int status = 0;
        if (waitpid(pid, &status, WNOHANG) == pid)
            return false;
        usleep(1000);
    }
}

int Wait(pid_t pid) {
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
}

// While a run works on a directory (held still, so that it cannot end meanwhile) a second run
// there is refused at once, naming it; Ctrl-C stops the first, which removes its temporary files
// and reports itself cancelled. Slices share the directory with each other, not with a whole
// run. A run that crashed leaves no lock behind.
TEST(Workflow, InterruptAndLock) {
    TempDir dir;
    const std::vector<std::string> args = MakeSample(dir);

    const pid_t first = Start(args, dir);
    ASSERT_TRUE(AtWork(first, dir)) << ReadFile(dir.File("background.txt"));
    ASSERT_EQ(kill(first, SIGSTOP), 0);
    const Result second = Ortho(args, dir);
    EXPECT_EQ(second.status, 1);
    EXPECT_NE(second.err.find(dir.File("out") + " is in use by another silvan-ortho run: process " +
                              std::to_string(first)),
              std::string::npos)
        << second.err;
    EXPECT_FALSE(std::filesystem::exists(dir.Path() / "out/summary.json"));
    ASSERT_EQ(kill(first, SIGINT), 0);
    ASSERT_EQ(kill(first, SIGCONT), 0);
    EXPECT_EQ(Wait(first), 130) << ReadFile(dir.File("background.txt"));
    EXPECT_EQ(TemporaryFiles(dir.Path() / "out"), std::vector<std::string>());
    CPLJSONDocument summary;
    ASSERT_TRUE(summary.Load(dir.File("out/summary.json")));
    EXPECT_EQ(summary.GetRoot().GetString("status"), "cancelled");

    const auto slice = [&](const char* lines) {
        std::vector<std::string> sliced = args;
        sliced.insert(sliced.end(), {"--lines", lines});
        return sliced;
    };
    const pid_t firstSlice = Start(slice("0:2"), dir);
    ASSERT_TRUE(AtWork(firstSlice, dir));
    ASSERT_EQ(kill(firstSlice, SIGSTOP), 0);
    const Result whole = Ortho(args, dir);
    EXPECT_EQ(whole.status, 1);
    EXPECT_NE(whole.err.find("process " + std::to_string(firstSlice) + " (--lines 0:2)"),
              std::string::npos)
        << whole.err;
    EXPECT_EQ(Ortho(slice("2:"), dir).status, 0);
    ASSERT_EQ(kill(firstSlice, SIGCONT), 0);
    EXPECT_EQ(Wait(firstSlice), 0) << ReadFile(dir.File("background.txt"));

    std::vector<std::string> again = args;
    again.push_back("--overwrite");
    const pid_t crashed = Start(again, dir);
    ASSERT_TRUE(AtWork(crashed, dir));
    ASSERT_EQ(kill(crashed, SIGKILL), 0);
    EXPECT_EQ(Wait(crashed), -SIGKILL);
    const Result after = Ortho(args, dir);
    EXPECT_EQ(after.status, 0) << after.err;
    EXPECT_EQ(TemporaryFiles(dir.Path() / "out"), std::vector<std::string>());
}
#endif
#endif
#endif

}  // namespace
