// Occlusion recovery on two orthos of a box building seen from opposite sides: each fills the
// other's hidden strip, the source raster names the scene of each pixel, and the choice rules.
#include <kestrel/trueortho.h>
#include <samplecity.h>

#include "rasterread.h"
#include "support.h"

#include <gdal_priv.h>

#include <filesystem>
#include <memory>

namespace {

using namespace kestrel::processes;
using testsupport::ReadBand;
using testsupport::TempDir;

// Two orthos of one box building, from the north (scene 1) and the south (scene 2), made once
// for all tests.
class OppositeViews : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        dir = new TempDir;
        options = samplecity::BoxScene(20.0, {0.0, 180.0});
        samplecity::MakeSample(dir->Path().string(), options, 2);
        surface = new samplecity::GridSurface(dir->File("dsm.tif"));
        const kestrel::ogc::cs::ICRS crs(options.crs);
        for (int s = 0; s < 2; ++s) {
            const std::string name = s == 0 ? "view000" : "view180";
            models[s] = new samplecity::RpcModel(dir->File(name + ".tif"));
            TorthoJob job;
            job.sourcePath = dir->File(name + ".tif");
            job.model = models[s];
            job.surface = surface;
            job.crs = &crs;
            job.geocoding = kestrel::ogc::cs::GeocodingInfo::NorthUp(
                options.west, options.south + options.sizeY, 0.5, 0.5);
            job.pixels = job.lines = kSize;
            job.orthoPath = dir->File(name + "_ortho.tif");
            job.visibilityPath = dir->File(name + "_vis.tif");
            ASSERT_TRUE(TorthoGenerator().Generate(job).completed);
        }
    }
    static void TearDownTestSuite() {
        delete models[0], delete models[1], delete surface, delete dir;
    }

    static RecoveryJob Job(int level1, int level2, int pixelError, bool withModels) {
        RecoveryJob job;
        for (int s = 0; s < 2; ++s) {
            const std::string name = s == 0 ? "view000" : "view180";
            RecoveryScene scene;
            scene.orthoPath = dir->File(name + "_ortho.tif");
            scene.visibilityPath = dir->File(name + "_vis.tif");
            scene.radiometricLevel = s == 0 ? level1 : level2;
            scene.dbmPixelError = pixelError;
            scene.model = withModels ? models[s] : nullptr;
            job.scenes.push_back(scene);
        }
        job.surface = withModels ? surface : nullptr;
        job.mosaicPath = dir->File("mosaic.tif");
        job.sourcePath = dir->File("source.tif");
        job.tileSize = 64;
        return job;
    }
    static std::vector<double> Visibility(int s) {
        return ReadBand(dir->File(s == 0 ? "view000_vis.tif" : "view180_vis.tif"));
    }

    static constexpr unsigned int kSize = 320;
    static TempDir* dir;
    static samplecity::CityOptions options;
    static samplecity::GridSurface* surface;
    static samplecity::RpcModel* models[2];
};

TempDir* OppositeViews::dir = nullptr;
samplecity::CityOptions OppositeViews::options;
samplecity::GridSurface* OppositeViews::surface = nullptr;
samplecity::RpcModel* OppositeViews::models[2] = {nullptr, nullptr};

TEST_F(OppositeViews, EachSceneFillsTheOthersHiddenStrip) {
    const TorthoRecoveryResult result = OcclusionRecovery().Recover(Job(1, 1, 1, true));
    ASSERT_TRUE(result.completed);
    const auto vis1 = Visibility(0), vis2 = Visibility(1);
    const auto source = ReadBand(dir->File("source.tif"));
    const auto mosaic = ReadBand(dir->File("mosaic.tif"), 2);
    const auto ortho2 = ReadBand(dir->File("view180_ortho.tif"), 2);
    const auto ortho1 = ReadBand(dir->File("view000_ortho.tif"), 2);
    size_t hidden[2] = {0, 0};
    for (size_t k = 0; k < source.size(); ++k) {
        if (vis1[k] == VISIBILITY_HIDDEN && vis2[k] == VISIBILITY_SEEN) {
            ++hidden[0];
            ASSERT_EQ(source[k], 2) << k;
            ASSERT_EQ(mosaic[k], ortho2[k]) << k;
        }
        if (vis2[k] == VISIBILITY_HIDDEN && vis1[k] == VISIBILITY_SEEN) {
            ++hidden[1];
            ASSERT_EQ(source[k], 1) << k;
            ASSERT_EQ(mosaic[k], ortho1[k]) << k;
        }
        if (vis1[k] != VISIBILITY_SEEN && vis2[k] != VISIBILITY_SEEN) {
            EXPECT_EQ(source[k], 0) << k;
        }
    }
    EXPECT_GT(hidden[0], 1000u);
    EXPECT_GT(hidden[1], 1000u);
    EXPECT_EQ(result.filled + result.unfilled, static_cast<unsigned long long>(kSize) * kSize);
}

TEST_F(OppositeViews, ChoiceRulesAmongScenesThatSeeAPixel) {
    const auto vis1 = Visibility(0), vis2 = Visibility(1);
    auto both = [&](size_t k) { return vis1[k] == VISIBILITY_SEEN && vis2[k] == VISIBILITY_SEEN; };
    auto nearHidden = [&](const std::vector<double>& vis, size_t k, int e) {
        const int i = static_cast<int>(k % kSize), j = static_cast<int>(k / kSize);
        for (int dj = -e; dj <= e; ++dj)
            for (int di = -e; di <= e; ++di) {
                const int x = i + di, y = j + dj;
                if (x >= 0 && y >= 0 && x < static_cast<int>(kSize) &&
                    y < static_cast<int>(kSize) &&
                    vis[static_cast<size_t>(y) * kSize + x] == VISIBILITY_HIDDEN)
                    return true;
            }
        return false;
    };

    // The lower radiometric difference level wins where both see clearly.
    ASSERT_TRUE(OcclusionRecovery().Recover(Job(3, 1, 0, true)).completed);
    auto source = ReadBand(dir->File("source.tif"));
    for (size_t k = 0; k < source.size(); ++k)
        if (both(k)) {
            ASSERT_EQ(source[k], 2) << k;
        }

    // Near its own hidden strip (within the pixel error) a scene gives way, whatever its level.
    ASSERT_TRUE(OcclusionRecovery().Recover(Job(1, 3, 3, true)).completed);
    source = ReadBand(dir->File("source.tif"));
    size_t gaveWay = 0;
    for (size_t k = 0; k < source.size(); ++k)
        if (both(k) && nearHidden(vis1, k, 3) && !nearHidden(vis2, k, 3)) {
            ASSERT_EQ(source[k], 2) << k;
            ++gaveWay;
        }
    EXPECT_GT(gaveWay, 50u);

    // At equal levels the line of sight nearer the vertical wins: the northern camera north of
    // the building, the southern one south of it. Without models the first scene wins.
    for (const bool withModels : {true, false}) {
        ASSERT_TRUE(OcclusionRecovery().Recover(Job(1, 1, 0, withModels)).completed);
        source = ReadBand(dir->File("source.tif"));
        const size_t north = 20 * kSize + 160, south = 300 * kSize + 160;
        ASSERT_TRUE(both(north) && both(south));
        EXPECT_EQ(source[north], 1);
        EXPECT_EQ(source[south], withModels ? 2 : 1);
    }
}

TEST_F(OppositeViews, CancelledOrRefusedRunsLeaveNoOutput) {
    std::filesystem::remove(dir->File("mosaic.tif"));
    std::filesystem::remove(dir->File("source.tif"));
    bool cancel = true;
    OcclusionRecovery recovery;
    recovery.SetCancelFlag(&cancel);
    EXPECT_FALSE(recovery.Recover(Job(1, 1, 1, true)).completed);

    // A scene on another grid: the ortho of a different size.
    RecoveryJob job = Job(1, 1, 1, false);
    job.scenes[1].orthoPath = dir->File("dsm.tif");
    job.scenes[1].visibilityPath = dir->File("dsm.tif");
    try {
        OcclusionRecovery().Recover(job);
        ADD_FAILURE() << "no exception";
    } catch (const kestrel::DataException& e) {
        EXPECT_NE(std::string(e.what()).find("dsm.tif"), std::string::npos) << e.what();
    }
    for (const char* name :
         {"mosaic.tif", "source.tif", "mosaic.tif.partial", "source.tif.partial"})
        EXPECT_FALSE(std::filesystem::exists(dir->File(name))) << name;
}

}  // namespace
