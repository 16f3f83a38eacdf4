// The command line of silvan-ortho: options and inputs checked before any work, --version, and
// images given instead of a master file, run as a user runs them; and the error messages of the
// other commands.
#include "program.h"

#include <gdal_priv.h>
#include <ogr_spatialref.h>

#include <array>
#include <filesystem>
#include <string>
#include <vector>

// The commands are built with the tools (SILVAN_BUILD_TOOLS).
#ifdef SILVAN_ORTHO_EXE
namespace {

namespace fs = std::filesystem;
using testsupport::ProgramResult;
using testsupport::ReadFile;
using testsupport::RunProgram;
using testsupport::TempDir;
using testsupport::WriteFile;

ProgramResult Ortho(const std::vector<std::string>& args, const TempDir& dir) {
    return RunProgram(SILVAN_ORTHO_EXE, args, dir);
}

// A small single-band GeoTIFF: enough to be told apart from a master file.
std::string WriteImage(const std::string& path) {
    GDALAllRegister();
    GDALDriver* gtiff = GetGDALDriverManager()->GetDriverByName("GTiff");
    GDALClose(gtiff->Create(path.c_str(), 4, 4, 1, GDT_Byte, nullptr));
    return path;
}

std::vector<std::string> Joined(std::vector<std::string> first,
                                const std::vector<std::string>& second) {
    first.insert(first.end(), second.begin(), second.end());
    return first;
}

struct CommandLine {
    std::vector<std::string> inputs;
    std::vector<std::string> options;  // after --out OUT --dem DEM, which they may override
    std::string message;
};

// Every option and input refused before any work: status 2, a message that names the option or
// file and shows no C++ signature, and no output directory.
TEST(OrthoCommandLine, BadOptionsAndInputsAreRefusedBeforeAnyWork) {
    TempDir dir;
    const std::string master = WriteFile(dir.File("master.txt"), "a.tif;1;0;;0;0;;0;FILL\n");
    const std::string dem = WriteFile(dir.File("dsm.tif"), "");
    const std::string image = WriteImage(dir.File("b.tif"));
    const std::string binary = WriteFile(dir.File("c.tif"), std::string("II*\0garbage", 11));
    const std::string semicolon = WriteImage(dir.File("d;e.tif"));
    const std::string absent = dir.File("absent.tif");
    fs::create_directories(dir.File("taken"));
    WriteFile(dir.File("taken/master.txt"), "mine.tif\n");
    // Vector files that are no seamline layer: another layer's name, points, no scene field.
    const auto layer = [&](const std::string& file, const std::string& name,
                           const std::string& geometry, const std::string& properties) {
        return WriteFile(dir.File(file), R"({"type": "FeatureCollection", "name": ")" + name +
                                             R"(", "features": [{"type": "Feature", )"
                                             R"("properties": )" + properties +
                                             R"(, "geometry": )" + geometry + "}]}");
    };
    const std::string square =
        R"({"type": "Polygon", "coordinates": [[[0, 0], [1, 0], [1, 1], [0, 0]]]})";
    const std::string cutline = layer("cut.geojson", "cut", square, R"({"scene": "a"})");
    const std::string points = layer("points.geojson", "seamlines",
                                     R"({"type": "Point", "coordinates": [0, 0]})", R"({"scene": "a"})");
    const std::string unnamed = layer("unnamed.geojson", "seamlines", square, R"({"name": "a"})");
    // Ground heights above mean sea level, as the file's CRS says, and an image whose math model
    // (its geotransform) has ellipsoidal heights.
    const auto georeferenced = [&](const std::string& file, const char* srs) {
        const std::string path = WriteImage(dir.File(file));
        GDALDataset* raster = GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_UPDATE);
        OGRSpatialReference crs;
        crs.SetFromUserInput(srs);
        raster->SetSpatialRef(&crs);
        double transform[6] = {500000, 1, 0, 5000000, 0, -1};
        raster->SetGeoTransform(transform);
        GDALClose(raster);
        return path;
    };
    const std::string msl = georeferenced("msl.tif", "EPSG:32632+5773");
    const std::string geo = georeferenced("geo.tif", "EPSG:32632");
    const std::string out = dir.File("out");
    const std::string textNotImage = ": a text file (a master parameter file?), not an image";
    const CommandLine cases[] = {
        {{master}, {"--srs", "EPSG:99999"}, "--srs: \"EPSG:99999\" names no coordinate system"},
        {{master}, {"--srs", "EPSG:4978"}, "neither a projected nor a geographic"},
        {{master}, {"--srs", "foo"}, "--srs: \"foo\" names no coordinate system: not an"},
        {{master}, {"--proc", "FPGA"}, "--proc: Cannot read PROC option \"FPGA\""},
        {{master}, {"--proc", "GPU:1,1"}, "--proc: Cannot read PROC option \"GPU:1,1\""},
        {{master}, {"--of", "nonsense"}, "--of: Unknown output file type \"nonsense\""},
        {{master}, {"--of", "mem"}, "--of: mem: GDAL's MEM driver keeps no pixels"},
        {{master}, {"--of", "xyz"}, "--of: xyz: GDAL's XYZ text holds no coordinate system"},
        {{master}, {"--of", "hdr"}, "--of: hdr names the ENVI header"},
        {{master}, {"--co", "FOO=BAR"}, "--co: Creation option \"FOO=BAR\" of GDAL's COG driver"},
        {{master}, {"--of", "jpg", "--co", "COMPRESS=LZW"}, "of GDAL's JPEG driver"},
        {{master}, {"--co", "COMPRESS=ZIP"}, "COMPRESS=ZIP\" of GDAL's COG driver"},
        {{master}, {"--co", "COMPRESS"}, "is written NAME=VALUE"},
        {{master}, {"--of", "png", "--co", "BLOCKSIZE=64"}, "of GDAL's PNG driver"},
        {{master}, {"--resample", "gauss"}, "--resample: unknown method \"gauss\""},
        {{master}, {"--resample", "nearest"}, "--resample: unknown method \"nearest\""},
        {{master}, {"--dem", absent}, "--dem: " + absent + ": not found"},
        {{master}, {"--tin", absent}, "--tin: " + absent + ": not found"},
        {{master}, {"--elevref", "XX"}, "--elevref: Unrecognized value"},
        {{master}, {"--elunits", "parsec"}, "--elunits: Unknown elevation unit"},
        {{master}, {"--elfactor", "1,0"}, "--elfactor: Invalid -elfactor argument"},
        {{master}, {"--elfactor", "1,x"}, "--elfactor: \"x\" is not a number"},
        {{master}, {"--tin", dem, "--dem", dem}, "exactly one of --dem and --tin"},
        {{master}, {"--jobs", "0"}, "--jobs: at least one job"},
        {{master}, {"--jobs", "two"}, "\"two\" is not a whole"},
        {{master}, {"--lines", "5:5"}, "empty slice"},
        {{master}, {"--lines", "x:2"}, "--lines: \"x\""},
        {{master}, {"--pixel-size", "-1"}, "--pixel-size: \"-1\" is not a positive size"},
        {{master}, {"--pixel-size", "0"}, "--pixel-size: \"0\" is not a positive size"},
        {{master}, {"--pixel-size", "nan"}, "is not a number"},
        {{master}, {"--tr", "1", "0"}, "--tr: \"0\" is not a positive size"},
        {{master}, {"--tr", "1"}, "--tr needs a value"},
        {{master}, {"--tr", "1", "1", "--pixel-size", "1"}, "give one of them"},
        {{master}, {"--te", "0", "0", "10", "x"}, "--te: \"x\" is not a number"},
        {{master}, {"--te", "10", "0", "0", "10"}, "--te: XMIN must be less than XMAX"},
        {{master}, {"--te", "0", "0", "1e9", "1", "--tr", "0.1", "1"}, "a grid of 10000000000 x 1"},
        {{master}, {"--te=0,0,1,1"}, "--te takes four values"},
        {{master}, {"--te-srs", "EPSG:4326"}, "--te-srs is the CRS of --te, which is missing"},
        {{master}, {"--te", "0", "0", "1", "1", "--te-srs", "EPSG:99999"}, "--te-srs: "},
        {{master}, {"--cutline", absent}, "--cutline: " + absent + ": cannot be opened"},
        {{master}, {"--cutline", master}, "--cutline: " + master + ": cannot be opened"},
        {{master}, {"--seamlines", absent}, "--seamlines: " + absent + ": cannot be opened"},
        {{master}, {"--seamlines", cutline}, "no layer \"seamlines\" (layers: cut)"},
        {{master}, {"--seamlines", points}, "layer \"seamlines\": holds Point geometries"},
        {{master}, {"--seamlines", unnamed}, "has no field \"scene\""},
        {{master}, {"--dtm", absent}, "--dtm: " + absent + ": not found"},
        {{master}, {"--dtm", master}, "--dtm: " + master + ": cannot be opened as a raster"},
        {{master},
         {"--dtm", msl, "--elevref", "ELLIPS"},
         "--dtm " + msl + ": the file says the heights are \"EGM96 height\""},
        {{master}, {"--blend-width", "wide"}, "--blend-width: \"wide\" is not a whole number"},
        {{master}, {"--blend-width", "5000"}, "--blend-width: \"5000\" is more than 4096"},
        // Options that hold for the sources' math models, checked on every model.
        {{geo},
         {"--dem", msl, "--elevref", "MATHMODEL"},
         "--elevref: " + geo + ": --dem " + msl + ": its CRS says the heights are \"EGM96"},
        {{geo}, {"--cameras", master}, "--cameras: " + master + " orients none of the images"},
        {{master}, {"--blend", "gauss"}, "--blend: \"gauss\" is not one of feather, multiband"},
        {{master}, {"--balance", "mean"}, "--balance: \"mean\" is not one of gain, gain-offset"},
        {{master}, {"--seams", "curved"}, "--seams: \"curved\" is not one of lines, pixel"},
        {{master}, {"--frobnicate"}, "unknown option"},
        {{master}, {"--dem"}, "--dem needs a value"},
        // A master file where images are expected, and the reverse, said plainly.
        {{image, master}, {}, master + textNotImage},
        {{master, master}, {}, "give either one master parameter file or images"},
        {{image, absent}, {}, absent + ": not found"},
        {{binary}, {}, "neither an image that GDAL can read nor a master parameter file"},
        {{dir.Path().string()}, {}, "a directory"},
        {{semicolon}, {}, "cannot hold this path"},
        {{image}, {"--out", dir.File("taken")}, "exists and was not written by silvan-ortho"},
    };
    for (const CommandLine& c : cases) {
        SCOPED_TRACE(c.message);
        std::vector<std::string> args = Joined(c.inputs, {"--out", out});
        if (c.options.empty() || (c.options[0] != "--tin" && c.options[0] != "--dem"))
            args = Joined(args, {"--dem", dem});
        const ProgramResult r = Ortho(Joined(args, c.options), dir);
        EXPECT_EQ(r.status, 2);
        EXPECT_NE(r.err.find(c.message), std::string::npos) << r.err;
        EXPECT_EQ(r.err.find("kestrel::"), std::string::npos) << r.err;
        EXPECT_EQ(r.err.find("(in "), std::string::npos) << r.err;
        EXPECT_FALSE(fs::exists(out));
    }
    EXPECT_EQ(ReadFile(dir.File("taken/master.txt")), "mine.tif\n");

    // Command lines without their essential parts.
    const std::pair<std::vector<std::string>, std::string> incomplete[] = {
        {{}, "the master parameter file is missing"},
        {{master, "--dem", dem}, "--out DIR is missing"},
        {{master, "--out", out}, "exactly one of --dem and --tin"},
    };
    for (const auto& [args, message] : incomplete) {
        const ProgramResult r = Ortho(args, dir);
        EXPECT_EQ(r.status, 2) << message;
        EXPECT_NE(r.err.find(message), std::string::npos) << r.err;
    }
    EXPECT_FALSE(fs::exists(out));
}

// Every value --help offers passes the checks: a slice beyond the master file's one line runs
// them and then has nothing to do.
TEST(OrthoCommandLine, ValuesThatHelpListsAreAccepted) {
    TempDir dir;
    const std::string master = WriteFile(dir.File("master.txt"), "a.tif;1;0;;0;0;;0;FILL\n");
    const std::string dem = WriteFile(dir.File("dsm.tif"), "");
    const std::vector<std::vector<std::string>> accepted = {
        {"--resample", "near"},    {"--resample", "bilinear"},    {"--resample", "cubic"},
        {"--resample", "lanczos"}, {"--resample", "cubicspline"}, {"--resample", "average"},
        {"--resample", "mode"},    {"--resample", "CUBIC"},       {"--of", "tif"},
        {"--of", "cog"},           {"--of", "png"},               {"--of", "envi"},
        {"--of", "img"},           {"--of", "gpkg"},              {"--srs", "EPSG:32632"},
        {"--of", "jpg"},           {"--of", "webp"},              {"--of", "jp2"},
        {"--co", "TILED=NO"},
        {"--srs", "EPSG:4326"},    {"--proc", "CPU:2"},           {"--elunits", "FOOT"},
        {"--co", "COMPRESS=JPEG"}, {"--co", "QUALITY=90"},        {"--co", "BLOCKSIZE=256"},
        {"--tr", "0.5", "0.25"},   {"--te", "9", "45", "9.1", "45.1", "--te-srs", "EPSG:4326"},
        {"--blend", "multiband"},  {"--balance", "gain"},         {"--balance", "none"},
        {"--blend-width", "0"},    {"--seams", "pixel"},
    };
    for (const auto& option : accepted) {
        SCOPED_TRACE(option[0] + " " + option[1]);
        const ProgramResult r = Ortho(
            Joined({master, "--out", dir.File("out"), "--dem", dem, "--lines", "5:6"}, option),
            dir);
        EXPECT_EQ(r.status, 0) << r.err;
    }

    // A graphics processor asked for: one line says that the central processor runs instead.
    const ProgramResult gpu = Ortho(
        {master, "--out", dir.File("out"), "--dem", dem, "--lines", "5:6", "--proc", "GPU"}, dir);
    EXPECT_EQ(gpu.status, 0) << gpu.err;
    EXPECT_NE(gpu.err.find("--proc GPU: no graphics processor can be used; the "
                           "central-processor generator runs instead"),
              std::string::npos)
        << gpu.err;

    const ProgramResult version = Ortho({"--version"}, dir);
    EXPECT_EQ(version.status, 0);
    EXPECT_EQ(version.out.rfind("silvan-ortho " SILVAN_VERSION " (GDAL ", 0), 0u) << version.out;
    const ProgramResult help = Ortho({"--help"}, dir);
    EXPECT_NE(help.out.find("silvan-ortho IMAGE [IMAGE...] --out DIR"), std::string::npos);
}

// Images instead of a master file: the sample city's images run with the default columns (and
// --of png, which GDAL writes by copy only), the master file used is written to DIR/master.txt
// with paths relative to it, and a second run leaves it as it is. The sample's own master file
// names its images relative to itself.
TEST(OrthoCommandLine, ImagesRunWithTheMasterFileWrittenForThem) {
    TempDir dir;
    const ProgramResult made =
        RunProgram(SILVAN_MAKE_SAMPLE_EXE,
                   {dir.File("sample"), "--box", "--image-size", "64", "--quiet"}, dir);
    ASSERT_EQ(made.status, 0) << made.err;
    const std::string sampleMaster = ReadFile(dir.File("sample/master.txt"));
    EXPECT_NE(sampleMaster.find("\nview000.tif;1,2,3;0;"), std::string::npos) << sampleMaster;
    EXPECT_NE(sampleMaster.find("\nview180.tif;1,2,3;0;"), std::string::npos) << sampleMaster;

    // PNG, which GDAL writes only by copy, with its georeferencing beside it.
    const std::vector<std::string> args = {dir.File("sample/view000.tif"),
                                           dir.File("sample/view180.tif"),
                                           "--out",
                                           dir.File("out"),
                                           "--dem",
                                           dir.File("sample/dsm.tif"),
                                           "--elevref",
                                           "ELLIPS",
                                           "--of",
                                           "png",
                                           "--quiet"};
    const ProgramResult first = Ortho(args, dir);
    ASSERT_EQ(first.status, 0) << first.err;
    const std::string written = dir.File("out/master.txt");
    EXPECT_EQ(ReadFile(written),
              "!MFILE written by silvan-ortho for the images on its command line\n"
              "!fili;dbic;mmseg;dbiw;srcBgd;edgeClip;radioDif;dbmPxErr;role\n"
              "../sample/view000.tif;;0;;;0;ANY;0;ORTHO\n"
              "../sample/view180.tif;;0;;;0;ANY;0;ORTHO\n");
    const std::string summary = ReadFile(dir.File("out/summary.json"));
    EXPECT_NE(summary.find("\"status\": \"complete\""), std::string::npos) << summary;

    // Every documented type round-trips with its georeferencing: the rasters lie where the PNG
    // run's do. Lossy types keep the visibility index and the source raster in lossless GeoTIFF,
    // with the same classes.
    GDALAllRegister();
    struct Raster {
        std::array<double, 6> geo{};
        std::string crs;
        std::vector<unsigned char> values;  // of the first band
    };
    const auto read = [](const std::string& path) {
        Raster raster;
        GDALDatasetH dataset = GDALOpen(path.c_str(), GA_ReadOnly);
        EXPECT_NE(dataset, nullptr) << path;
        if (dataset == nullptr)
            return raster;
        EXPECT_EQ(GDALGetGeoTransform(dataset, raster.geo.data()), CE_None) << path;
        const OGRSpatialReferenceH srs = GDALGetSpatialRef(dataset);
        EXPECT_NE(srs, nullptr) << path;
        if (srs != nullptr && OSRGetAuthorityCode(srs, nullptr) != nullptr)
            raster.crs = OSRGetAuthorityCode(srs, nullptr);
        const int width = GDALGetRasterXSize(dataset), height = GDALGetRasterYSize(dataset);
        raster.values.resize(static_cast<std::size_t>(width) * height);
        EXPECT_EQ(GDALRasterIO(GDALGetRasterBand(dataset, 1), GF_Read, 0, 0, width, height,
                               raster.values.data(), width, height, GDT_Byte, 0, 0),
                  CE_None);
        GDALClose(dataset);
        return raster;
    };
    const std::vector<std::string> names = {"mosaic", "view000_ortho", "view180_vis",
                                            "mosaic_source"};
    std::vector<Raster> png;
    for (const std::string& name : names)
        png.push_back(read(dir.File("out/" + name + ".png")));
    const struct {
        const char* type;
        const char* ext;      // of the ortho and the mosaic
        const char* classes;  // of the visibility index and the source raster
    } types[] = {{"tif", "tif", "tif"},  {"cog", "tif", "tif"},  {"img", "img", "img"},
                 {"gpkg", "gpkg", "gpkg"}, {"jpg", "jpg", "tif"}, {"webp", "webp", "tif"},
                 {"jp2", "jp2", "tif"}};
    for (const auto& t : types) {
        SCOPED_TRACE(t.type);
        std::vector<std::string> typed = args;
        typed[3] = dir.File(std::string("out-") + t.type);
        typed[typed.size() - 2] = t.type;
        const ProgramResult run = Ortho(typed, dir);
        ASSERT_EQ(run.status, 0) << run.err;
        for (std::size_t k = 0; k < names.size(); ++k) {
            const Raster raster =
                read(typed[3] + "/" + names[k] + "." + (k < 2 ? t.ext : t.classes));
            for (std::size_t i = 0; i < raster.geo.size(); ++i)  // GeoPackage rounds a little
                EXPECT_NEAR(raster.geo[i], png[k].geo[i], 1e-6 * png[k].geo[1]) << names[k];
            EXPECT_EQ(raster.crs, png[k].crs) << names[k];
            if (k >= 2) {
                EXPECT_EQ(raster.values, png[k].values) << names[k];
            }
        }
    }

    // A master file whose line names a text file: said plainly.
    const std::string wrong =
        WriteFile(dir.File("wrong.txt"), dir.File("sample/master.txt") + ";;0;;;0;;0;ORTHO\n");
    const ProgramResult text =
        Ortho({wrong, "--out", dir.File("wrong"), "--dem", dir.File("sample/dsm.tif")}, dir);
    EXPECT_EQ(text.status, 1);
    EXPECT_NE(text.err.find(dir.File("sample/master.txt") + ": not a raster that GDAL can read"),
              std::string::npos)
        << text.err;

    const auto madeAt = fs::last_write_time(written);
    const ProgramResult second = Ortho(args, dir);
    EXPECT_EQ(second.status, 0) << second.err;
    EXPECT_EQ(fs::last_write_time(written), madeAt);
}

}  // namespace

// The other commands print the message and the file it is about, never where in the code the
// error was raised.
TEST(CommandMessages, NameTheFileWithoutCodeLocations) {
    TempDir dir;
    const std::string tools = SILVAN_TOOLS_DIR;
    const std::string absent = dir.File("absent.tif");
    const struct {
        std::string program;
        std::vector<std::string> args;
    } cases[] = {
        {"silvan-filelist", {absent}},
        {"silvan-layout", {absent, "--dem", absent}},
        {"silvan-height", {absent}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.program);
        const ProgramResult r = RunProgram(tools + "/" + c.program, c.args, dir);
        EXPECT_EQ(r.status, 1);
        EXPECT_EQ(r.err.rfind(c.program + ": ", 0), 0u) << r.err;
        EXPECT_NE(r.err.find(absent), std::string::npos) << r.err;
        EXPECT_EQ(r.err.find("(in "), std::string::npos) << r.err;
    }
    // An image where a parameter file is expected.
    const ProgramResult image =
        RunProgram(tools + "/silvan-filelist", {WriteImage(dir.File("a.tif"))}, dir);
    EXPECT_EQ(image.status, 1);
    EXPECT_NE(image.err.find("(a binary file, such as an image, is no parameter file)"),
              std::string::npos)
        << image.err;
}
#endif  // SILVAN_ORTHO_EXE
