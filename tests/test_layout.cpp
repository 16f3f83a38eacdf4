// The ortho layout: what GetOrthoParams hands to the layout functions and makes of their
// answers (through the layout seam), and the layout itself on a real RPC image over terrain,
// checked against gdalwarp.
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include <gdal_priv.h>

#include <kestrel/dem.h>
#include <kestrel/elevation.h>
#include <kestrel/exception.h>
#include <kestrel/mathmodel.h>
#include <kestrel/orthoutils.h>
#include <silvan/utils.h>

#include "rpcscene.h"
#include "surface.h"
#include "samplecity.h"
#include "program.h"


using kestrel::ogc::cs::GeocodingInfo;
using kestrel::ogc::cs::ICRS;
using kestrel::tin::Polygon;
using testsupport::FunctionSurface;
using testsupport::RunCommand;
using testsupport::TempDir;

namespace {

// Records the calls that reach the layout functions and answers with what the test set.
class RecordingLayout final : public kestrel::orthoutils::LayoutImpl {
  public:
    // What GetLayoutOptions received.
    std::vector<std::string> strings;
    int borderSamples = 0;
    std::string mapCRSName = "(not called)";
    double pixelWidth = 0, pixelHeight = 0;
    float flatHeight = 0;
    kestrel::datasources::IRasterDataset* dataset = nullptr;
    const kestrel::mathmodel::IMathModel* model = nullptr;
    std::vector<int> channels;
    // What it answers.
    unsigned int linesOut = 0, pixelsOut = 0;
    bool throwInLayout = false;
    // What GetSceneFootprint received, and answers.
    const GeocodingInfo* footprintGeocoding = nullptr;
    unsigned int footprintPixels = 0, footprintLines = 0;
    std::vector<double> footprintX, footprintY;
    std::vector<GDBVertex> ring;
    // What GetSrcModel received.
    std::string modelPath, modelUnused = "(not called)";
    int modelSegment = 0;

    kestrel::mathmodel::IMathModel* GetSrcModel(const std::string& path, const std::string& unused,
                                                int segment) override {
        modelPath = path, modelUnused = unused, modelSegment = segment;
        return nullptr;
    }

    void GetLayoutOptions(const std::string& a, const std::string& b, const std::string& c,
                          const std::string& d, int samples, const std::string& alignment,
                          const ICRS* mapCRS, double& width, double& height,
                          const kestrel::dem::IRasterDEM*, float flat,
                          kestrel::datasources::IRasterDataset* raster,
                          const kestrel::mathmodel::IMathModel* sensor,
                          const std::vector<int>& channelList, ICRS*& outCRS,
                          GeocodingInfo*& outGeocoding, unsigned int& lines, unsigned int& pixels,
                          std::vector<double>& x, std::vector<double>& y, double& low,
                          double& high) override {
        strings = {a, b, c, d, alignment};
        borderSamples = samples;
        mapCRSName = mapCRS == nullptr ? "(null)" : mapCRS->GetName();
        pixelWidth = width, pixelHeight = height;
        width = height = 99.0;  // must not reach GetOrthoParams's caller
        flatHeight = flat;
        dataset = raster;
        model = sensor;
        channels = channelList;
        EXPECT_TRUE(x.empty() && y.empty());
        outCRS = new ICRS("EPSG:32632");
        outGeocoding = new GeocodingInfo(GeocodingInfo::NorthUp(514000, 5034000, 1, 1));
        lines = linesOut;
        pixels = pixelsOut;
        if (throwInLayout)
            KESTREL_THROW(kestrel::DataException, "layout refused by the test");
        x = {1, 2, 3};
        y = {4, 5, 6};
        low = high = 0;
    }

    int GetSceneFootprint(const GeocodingInfo* geocoding, unsigned int pixels, unsigned int lines,
                          const std::vector<double>& x, const std::vector<double>& y,
                          GDBVertex*& vertices, int& count) override {
        EXPECT_EQ(vertices, nullptr);
        footprintGeocoding = geocoding;
        footprintPixels = pixels, footprintLines = lines;
        footprintX = x, footprintY = y;
        vertices = new GDBVertex[ring.size()];
        std::copy(ring.begin(), ring.end(), vertices);
        count = static_cast<int>(ring.size());
        return count;
    }
};

// A dataset that is not a raster: GetOrthoParams's cast must give null.
class NotARaster final : public kestrel::datasources::IDataset {
  public:
    bool IsValid() const override { return true; }
    std::string GetPath() const override { return "table.csv"; }
};

struct Outputs {
    ICRS* crs = nullptr;
    GeocodingInfo* geocoding = nullptr;
    unsigned int pixels = 0, lines = 0;
    Polygon<double>* footprint = nullptr;
    ~Outputs() {
        delete crs;
        delete geocoding;
        delete footprint;
    }
};

void Call(Outputs& out, const std::string& mapUnits,
          kestrel::datasources::IDataset* dataset = nullptr) {
    GetOrthoParams(5, "EXTENT", mapUnits, 0.5, 0.25, dataset,
                   reinterpret_cast<kestrel::mathmodel::IMathModel*>(0x10), {3, 1}, nullptr, 12.5f,
                   out.crs, out.geocoding, out.pixels, out.lines, out.footprint);
}

std::shared_ptr<RecordingLayout> SquareLayout() {
    auto layout = std::make_shared<RecordingLayout>();
    layout->linesOut = 17;
    layout->pixelsOut = 1000;
    layout->ring = {{0, 0, 0}, {10, 0, 0}, {10, 10, 0}, {0, 10, 0}, {0, 0, 0}};
    return layout;
}

}  // namespace

// The map-units text: empty or beginning with "None" in any case gives no coordinate system;
// anything else goes to MapunitsToCRS, so "Non" is refused as naming none.
TEST(GetOrthoParams, MapUnitsNoneInAnyCaseMakesNoCoordinateSystem) {
    const struct {
        const char* text;
        const char* expected;  // the CRS name GetLayoutOptions sees; null: MapunitsToCRS throws
    } cases[] = {{"", "(null)"},
                 {"None", "(null)"},
                 {"nOnE", "(null)"},
                 {"NONE whatever", "(null)"},
                 {"EPSG:32632", "WGS 84 / UTM zone 32N"},
                 {"Non", nullptr},
                 {" None", nullptr}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.text);
        auto layout = SquareLayout();
        kestrel::orthoutils::ScopedLayoutImpl scoped(layout);
        Outputs out;
        if (c.expected == nullptr) {
            EXPECT_THROW(Call(out, c.text), kestrel::DataException);
            EXPECT_EQ(layout->mapCRSName, "(not called)");
        } else {
            Call(out, c.text);
            EXPECT_EQ(layout->mapCRSName, c.expected);
        }
    }
}

// Arguments reach GetLayoutOptions in their places; lines come back before pixels from it and
// go to GetSceneFootprint after them, rounded up to blocks of 16 first; the closing vertex of
// the ring is dropped.
TEST(GetOrthoParams, RoutesArgumentsAndRoundsToBlocksBeforeTheFootprint) {
    auto layout = SquareLayout();
    kestrel::orthoutils::ScopedLayoutImpl scoped(layout);
    Outputs out;
    NotARaster table;
    Call(out, "", &table);
    EXPECT_EQ(layout->strings, (std::vector<std::string>{"", "", "", "", "EXTENT"}));
    EXPECT_EQ(layout->borderSamples, 5);
    EXPECT_EQ(layout->pixelWidth, 0.5);
    EXPECT_EQ(layout->pixelHeight, 0.25);
    EXPECT_EQ(layout->flatHeight, 12.5f);
    EXPECT_EQ(layout->dataset, nullptr);
    EXPECT_EQ(layout->model, reinterpret_cast<kestrel::mathmodel::IMathModel*>(0x10));
    EXPECT_EQ(layout->channels, (std::vector<int>{3, 1}));

    EXPECT_EQ(out.pixels, 1008u);
    EXPECT_EQ(out.lines, 32u);
    EXPECT_EQ(layout->footprintPixels, 1008u);
    EXPECT_EQ(layout->footprintLines, 32u);
    EXPECT_EQ(layout->footprintGeocoding, out.geocoding);
    EXPECT_EQ(layout->footprintX, (std::vector<double>{1, 2, 3}));
    EXPECT_EQ(layout->footprintY, (std::vector<double>{4, 5, 6}));
    ASSERT_NE(out.crs, nullptr);
    ASSERT_NE(out.footprint, nullptr);
    ASSERT_EQ(out.footprint->numPoints, 4u);
    EXPECT_EQ(out.footprint->points[3].x, 0.0);
    EXPECT_EQ(out.footprint->points[3].y, 10.0);
    EXPECT_EQ(out.footprint->bbox.max.x, 10.0);
}

TEST(GetOrthoParams, BlockRuleAndNearDuplicateVertices) {
    const unsigned int sizes[][2] = {{1000, 1008}, {1001, 1008}, {1024, 1024},
                                     {16, 16},     {1, 16},      {0, 0}};
    for (const auto& size : sizes) {
        auto layout = SquareLayout();
        layout->pixelsOut = layout->linesOut = size[0];
        layout->ring = {{0, 0, 0}, {10, 0, 0}, {10, 4e-10, 0}, {10, 10, 0}, {0, 0, 0}};
        kestrel::orthoutils::ScopedLayoutImpl scoped(layout);
        Outputs out;
        Call(out, "");
        EXPECT_EQ(out.pixels, size[1]) << size[0];
        EXPECT_EQ(out.lines, size[1]) << size[0];
        ASSERT_EQ(out.footprint->numPoints, 3u);
    }
}

// A failing layout leaves the footprint output alone; a footprint of fewer than two vertices
// is refused after the sizes were rounded.
TEST(GetOrthoParams, FailuresLeaveTheFootprintOutputUnchanged) {
    Polygon<double> sentinel(nullptr, 0);
    {
        auto layout = SquareLayout();
        layout->throwInLayout = true;
        kestrel::orthoutils::ScopedLayoutImpl scoped(layout);
        Outputs out;
        out.footprint = &sentinel;
        EXPECT_THROW(Call(out, "EPSG:32632"), kestrel::DataException);
        EXPECT_EQ(out.footprint, &sentinel);
        out.footprint = nullptr;
    }
    for (std::size_t count : {0u, 1u}) {
        auto layout = SquareLayout();
        layout->ring.resize(count);
        kestrel::orthoutils::ScopedLayoutImpl scoped(layout);
        Outputs out;
        out.footprint = &sentinel;
        EXPECT_THROW(Call(out, ""), kestrel::DataException);
        EXPECT_EQ(out.footprint, &sentinel);
        EXPECT_EQ(out.pixels, 1008u);
        EXPECT_EQ(out.lines, 32u);
        out.footprint = nullptr;
    }
}

TEST(GetMathModelAndGetMetaTrans, HandTheirArgumentsOn) {
    auto layout = SquareLayout();
    kestrel::orthoutils::ScopedLayoutImpl scoped(layout);
    EXPECT_EQ(GetMathModel("scene.tif", 2), nullptr);
    EXPECT_EQ(layout->modelPath, "scene.tif");
    EXPECT_EQ(layout->modelUnused, "");
    EXPECT_EQ(layout->modelSegment, 2);
    std::unique_ptr<kestrel::processes::ortho::OrthoMetadataTransfer> transfer(GetMetaTrans(-9.5));
    EXPECT_EQ(transfer->GetNoDataValue(), -9.5);
}

TEST(OrthoMetadataTransfer, CopiesMetadataDescriptionsColoursAndSetsNoData) {
    TempDir dir;
    GDALAllRegister();
    GDALDriver* gtiff = GetGDALDriverManager()->GetDriverByName("GTiff");
    {
        std::unique_ptr<GDALDataset> src(
            gtiff->Create(dir.File("src.tif").c_str(), 8, 8, 2, GDT_Byte, nullptr));
        src->SetMetadataItem("ACQUISITION", "2026-05-01");
        src->GetRasterBand(2)->SetDescription("near infrared");
        src->GetRasterBand(2)->SetColorInterpretation(GCI_RedBand);
        src->GetRasterBand(2)->SetNoDataValue(7);
        std::unique_ptr<GDALDataset> ortho(
            gtiff->Create(dir.File("ortho.tif").c_str(), 8, 8, 1, GDT_Byte, nullptr));
    }
    kestrel::processes::ortho::OrthoMetadataTransfer(0.0).Transfer(dir.File("src.tif"),
                                                                   dir.File("ortho.tif"), {2});
    std::unique_ptr<GDALDataset> ortho(GDALDataset::Open(dir.File("ortho.tif").c_str()));
    EXPECT_STREQ(ortho->GetMetadataItem("ACQUISITION"), "2026-05-01");
    EXPECT_STREQ(ortho->GetRasterBand(1)->GetDescription(), "near infrared");
    EXPECT_EQ(ortho->GetRasterBand(1)->GetColorInterpretation(), GCI_RedBand);
    int has = 0;
    EXPECT_EQ(ortho->GetRasterBand(1)->GetNoDataValue(&has), 0.0);
    EXPECT_TRUE(has);
    ortho.reset();
    EXPECT_THROW(kestrel::processes::ortho::OrthoMetadataTransfer(NAN).Transfer(
                     dir.File("src.tif"), dir.File("ortho.tif"), {3}),
                 kestrel::DataException);
}

// ---------------------------------------------------------------------------------------------
// The layout on a real scene

namespace {

FunctionSurface SceneHills() {
    return FunctionSurface(&rpcscene::Hills, rpcscene::kDemLeft,
                           rpcscene::kDemTop - rpcscene::kDemSize,
                           rpcscene::kDemLeft + rpcscene::kDemSize, rpcscene::kDemTop);
}


}  // namespace

// The traced extent matches the one gdalwarp chooses with the DEM for the same pixel size,
// within 2 pixels on each side; GetOrthoParams makes of it a grid in whole blocks of 16 with
// the footprint inside.
TEST(Layout, ExtentAgreesWithGdalwarpOverTerrain) {
    TempDir dir;
    const std::string image = dir.File("src.tif"), demPath = dir.File("dem.tif");
    rpcscene::WriteRpcImage(image, 1000, 800);
    rpcscene::WriteDem(demPath, rpcscene::kDemLeft, rpcscene::kDemTop, 10.0, 800, 800,
                       rpcscene::Hills);
    const std::string out = dir.File("ortho.tif");
    const std::string log = RunCommand("gdalwarp -q -rpc -to RPC_DEM=" + demPath +
                                       " -to RPC_DEMINTERPOLATION=bilinear -t_srs EPSG:32632 "
                                       "-tr 1.5 1.5 " +
                                       image + " " + out + " 2>&1");
    std::unique_ptr<GDALDataset> warped(GDALDataset::Open(out.c_str()));
    ASSERT_NE(warped, nullptr) << log;
    double gt[6];
    warped->GetGeoTransform(gt);
    const double reference[4] = {gt[0], gt[3] + gt[5] * warped->GetRasterYSize(),
                                 gt[0] + gt[1] * warped->GetRasterXSize(), gt[3]};

    std::unique_ptr<kestrel::mathmodel::IMathModel> model(GetMathModel(image, 0));
    std::unique_ptr<kestrel::dem::IRasterDEM> dem(kestrel::dem::DEMFactory::CreateFileRasterDEM(
        demPath, 1, 0.0, 1.0, NAN, kestrel::ogc::cs::DatumEllipsoid, false, 64));
    double pixelWidth = 1.5, pixelHeight = 1.5, low = 0, high = 0;
    ICRS* crsOut = nullptr;
    GeocodingInfo* geocodingOut = nullptr;
    unsigned int lines = 0, pixels = 0;
    std::vector<double> borderX, borderY;
    GetLayoutOptions("", "", "", "", 0, "EXTENT", nullptr, pixelWidth, pixelHeight, dem.get(), 0.0f,
                     nullptr, model.get(), {}, crsOut, geocodingOut, lines, pixels, borderX,
                     borderY, low, high);
    const std::unique_ptr<ICRS> crs(crsOut);
    const std::unique_ptr<GeocodingInfo> geocoding(geocodingOut);
    ASSERT_NE(crs, nullptr);
    EXPECT_EQ(crs->GetName(), "WGS 84 / UTM zone 32N");
    const auto& g = geocoding->GetGeoTransform();
    const double ours[4] = {g[0], g[3] - 1.5 * lines, g[0] + 1.5 * pixels, g[3]};
    for (int side = 0; side < 4; ++side)
        EXPECT_NEAR(ours[side], reference[side], 2 * 1.5) << "side " << side;
    EXPECT_GE(low, 150.0);
    EXPECT_LE(high, 400.0);

    GDBVertex* vertices = nullptr;
    int count = 0;
    GetSceneFootprint(geocoding.get(), pixels, lines, borderX, borderY, vertices, count);
    std::unique_ptr<GDBVertex[]> ring(vertices);
    ASSERT_GE(count, 4);
    EXPECT_LT(count, static_cast<int>(borderX.size()));
    EXPECT_EQ(ring[0].x, ring[count - 1].x);
    EXPECT_EQ(ring[0].y, ring[count - 1].y);

    // The library's call: the same grid corner, whole blocks, the footprint inside.
    Outputs layout;
    GetOrthoParams(0, "EXTENT", "", 1.5, 1.5, nullptr, model.get(), {}, dem.get(), 0.0f, layout.crs,
                   layout.geocoding, layout.pixels, layout.lines, layout.footprint);
    EXPECT_EQ(layout.geocoding->GetGeoTransform(), g);
    EXPECT_EQ(layout.pixels, (pixels + 15) / 16 * 16);
    EXPECT_EQ(layout.lines, (lines + 15) / 16 * 16);
    ASSERT_GE(layout.footprint->numPoints, 3u);
    for (unsigned int i = 0; i < layout.footprint->numPoints; ++i) {
        double p, l;
        layout.geocoding->GroundToPixel(layout.footprint->points[i].x,
                                        layout.footprint->points[i].y, p, l);
        EXPECT_TRUE(p >= -1e-6 && p <= pixels + 1e-6 && l >= -1e-6 && l <= lines + 1e-6)
            << p << " " << l;
    }
}

// A DEM that covers the whole scene, or part of it: the latter gives the layout of the covered
// ground and says what share it leaves out; one that misses all of it, or covers under 2 %, and
// requests that would give a useless grid, are refused with what was wrong.
TEST(Layout, PartialTerrainCutsTheSceneAndTooLittleIsRefused) {
    TempDir dir;
    const std::string image = dir.File("src.tif");
    rpcscene::WriteRpcImage(image, 1000, 800);
    std::unique_ptr<kestrel::mathmodel::IMathModel> model(GetSrcModel(image, "", 0));
    auto expectMessage = [&](const kestrel::dem::IElevationSource* terrain,
                             const kestrel::orthoutils::LayoutRequest& request,
                             const std::string& text) {
        const std::string message = testsupport::ThrownMessage<kestrel::DataException>(
            [&] { kestrel::orthoutils::ComputeLayout(*model, terrain, request); }, text);
        EXPECT_TRUE(testsupport::Contains(message, text)) << message;
    };
    const kestrel::orthoutils::LayoutRequest plain;
    // The scene's centre is near (514900, 5034000).
    const FunctionSurface terrain = SceneHills();
    const kestrel::orthoutils::Layout whole =
        kestrel::orthoutils::ComputeLayout(*model, &terrain, plain);
    EXPECT_EQ(whole.uncoveredShare, 0.0);
    // Without a pixel size, the source's ground resolution (about 1.5 m), and corners on whole
    // multiples of it.
    EXPECT_NEAR(whole.pixelWidth, 1.5, 0.2);
    EXPECT_EQ(whole.pixelWidth, whole.pixelHeight);
    for (const int corner : {0, 3})
        EXPECT_NEAR(std::remainder(whole.geocoding.GetGeoTransform()[corner], whole.pixelWidth),
                    0.0, 1e-6);
    const auto xs = std::minmax_element(whole.borderX.begin(), whole.borderX.end());
    const double west = *xs.first, east = *xs.second;
    const FunctionSurface half(&rpcscene::Hills, 511000, 5030000, (west + east) / 2, 5038000);
    const kestrel::orthoutils::Layout cut =
        kestrel::orthoutils::ComputeLayout(*model, &half, plain);
    EXPECT_NEAR(cut.uncoveredShare, 0.5, 0.1);
    for (double x : cut.borderX)
        EXPECT_LE(x, (west + east) / 2 + 1e-6);
    EXPECT_NEAR(cut.geocoding.GetGeoTransform()[0], whole.geocoding.GetGeoTransform()[0], 2.0);
    EXPECT_LT(cut.pixels, whole.pixels * 0.6);
    const FunctionSurface sliver(&rpcscene::Hills, 511000, 5030000, west + (east - west) * 0.01,
                                 5038000);
    expectMessage(&sliver, plain, "% of the scene's ground, under the 2 % needed");
    const FunctionSurface far(&rpcscene::Hills, 600000, 5030000, 608000, 5038000);
    expectMessage(&far, plain, "miss the DEM entirely");

    kestrel::orthoutils::LayoutRequest request;
    request.pixelWidth = -1;
    expectMessage(&terrain, request, "is not a finite value of 0 or more");
    request.pixelWidth = NAN;
    expectMessage(&terrain, request, "is not a finite value of 0 or more");
    request.pixelWidth = request.pixelHeight = 1e-4;
    expectMessage(&terrain, request, "larger than");
}

// A nadir frame camera whose centre ray is plumb, 90.2 m above flat ground: the layout lies on
// the ground (75 m across), not at the height of 0 that a model blind to heights would take.
TEST(Layout, PlumbCentreRayOfANadirCameraMeetsTheTerrain) {
    kestrel::mathmodel::CameraIntrinsics lens;
    lens.width = lens.height = 500;
    lens.fx = lens.fy = 600;
    lens.cx = lens.cy = 249.5;
    kestrel::mathmodel::CameraPose pose;
    pose.crs = "EPSG:32632";
    pose.centre = {514845, 5033745, 340.225};
    pose.rotation = {6.123233995736766e-17, -1, 0, -1, -6.123233995736766e-17, 0, 0, 0, -1};
    const auto model = kestrel::mathmodel::MakeFrameCameraModel(lens, pose, "nadir");
    const FunctionSurface flat([](double, double) { return 250.0; }, 514700, 5033600, 515000,
                               5033900);
    const auto layout = kestrel::orthoutils::ComputeLayout(*model, &flat, {});
    const auto xs = std::minmax_element(layout.borderX.begin(), layout.borderX.end());
    EXPECT_NEAR(*xs.second - *xs.first, 75.0, 0.5);
    EXPECT_NEAR(layout.pixelWidth, 0.15, 0.005);
}

// Over a DSM with a 30 m box building across the image's border, every border ray meets the
// surface where the camera's own ray does, on the roof, on the walls and on the ground alike
// (GDAL's RPC image-to-ground iteration does not converge on walls).
TEST(Layout, BorderRaysMeetRoofsAndWallsWhereTheCameraSeesThem) {
    TempDir dir;
    samplecity::CityOptions city = samplecity::BoxScene(30.0, {}, 30.0, 128);
    city.cameras.push_back({"edge", 45.0, 30.0, 300.0, 128, 128, 0.5});
    const samplecity::Sample sample = samplecity::MakeSample(dir.Path().string(), city, 1);
    const samplecity::Dsm dsm(city);
    const samplecity::FrameCamera& camera = *sample.images[0].camera;

    std::unique_ptr<kestrel::mathmodel::IMathModel> model(
        GetSrcModel(sample.images[0].path, "", 0));
    std::unique_ptr<kestrel::dem::IRasterDEM> surface(kestrel::dem::DEMFactory::CreateFileRasterDEM(
        sample.dsmPath, 1, 0.0, 1.0, NAN, kestrel::ogc::cs::DatumEllipsoid, false, 16));
    kestrel::orthoutils::LayoutRequest request;
    const int perEdge = 64;
    request.borderSamples = perEdge;
    const auto layout = kestrel::orthoutils::ComputeLayout(*model, surface.get(), request);
    ASSERT_EQ(layout.borderX.size(), 4u * perEdge);
    EXPECT_GT(layout.maxHeight, layout.minHeight + 20.0);

    int raised = 0;
    for (int i = 0; i < 4 * perEdge; ++i) {
        const int edge = i / perEdge;
        const double t = static_cast<double>(i % perEdge) / perEdge;
        const double positions[4][2] = {
            {t * 128, 0}, {128, t * 128}, {(1 - t) * 128, 128}, {0, (1 - t) * 128}};
        std::array<double, 3> origin, direction, hit;
        camera.Ray(positions[edge][0], positions[edge][1], origin, direction);
        ASSERT_TRUE(dsm.Intersect(origin, direction, hit));
        raised += hit[2] > dsm.Ground(hit[0], hit[1]) + 1.0;
        EXPECT_NEAR(layout.borderX[i], hit[0], 0.3) << i;
        EXPECT_NEAR(layout.borderY[i], hit[1], 0.3) << i;
    }
    EXPECT_GT(raised, 10);  // the border crosses the building
}
