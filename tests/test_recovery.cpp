// Occlusion recovery on two orthos of a box building seen from opposite sides: each fills the
// other's hidden strip, the source raster names the scene of each pixel, and the choice rules;
// then on synthetic visibility indexes, the rules at every pixel and the cost of many scenes.
#include <kestrel/trueortho.h>
#include <samplecity.h>

#include "../platform/src/trueortho/recoverygrid.h"
#include "../platform/src/trueortho/runcontrol.h"
#include "rasterread.h"
#include "support.h"

#include <gdal_priv.h>
#include <gdal_utils.h>

#include <algorithm>
#include <atomic>
#include <cmath>
#include <filesystem>
#include <memory>
#include <random>
#include <set>
#include <tuple>

#if !defined(_WIN32)
#include <sys/resource.h>
#endif

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
        job.seamlines = false, job.blendWidth = 0, job.balance = RecoveryJob::Balance::None;
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

// Without seamlines and with them (blended across the seams; the ground estimated or given),
// each scene fills the other's hidden strip with its own values: a scene's weight is zero where
// it does not see the ground.
TEST_F(OppositeViews, EachSceneFillsTheOthersHiddenStrip) {
    for (const int variant : {0, 1, 2}) {
        const bool seamlines = variant > 0;
        SCOPED_TRACE(variant == 0   ? "first-ranked scene per pixel"
                     : variant == 1 ? "seamlines, ground from the surface"
                                    : "seamlines, ground given");
        RecoveryJob job = Job(1, 1, 1, true);
        job.seamlines = seamlines;
        job.blendWidth = seamlines ? 16 : 0;
        job.ground = variant == 2 ? surface : nullptr;
        const TorthoRecoveryResult result = OcclusionRecovery().Recover(job);
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
            // Nor does a scene weigh in the other's region within its pixel error of a pixel
            // it does not see: its values there show the building's edge.
            const int x = static_cast<int>(k % kSize), y = static_cast<int>(k / kSize);
            bool near[2] = {false, false};
            for (int dy = -1; dy <= 1; ++dy)
                for (int dx = -1; dx <= 1; ++dx) {
                    const int nx = x + dx, ny = y + dy;
                    if (nx < 0 || ny < 0 || nx >= static_cast<int>(kSize) || ny >= static_cast<int>(kSize))
                        continue;
                    const size_t q = static_cast<size_t>(ny) * kSize + nx;
                    near[0] = near[0] || vis1[q] == VISIBILITY_HIDDEN;
                    near[1] = near[1] || vis2[q] == VISIBILITY_HIDDEN;
                }
            if (near[0] && source[k] == 2) {
                ASSERT_EQ(mosaic[k], ortho2[k]) << k;
            }
            if (near[1] && source[k] == 1) {
                ASSERT_EQ(mosaic[k], ortho1[k]) << k;
            }
        }
        EXPECT_GT(hidden[0], 1000u);
        EXPECT_GT(hidden[1], 1000u);
        EXPECT_EQ(result.filled + result.unfilled, static_cast<unsigned long long>(kSize) * kSize);
        if (variant == 1) {
            // Both scenes see the whole roof: one of them takes it whole, and the seams run
            // along its outline, not a pixel or two inside the wall behind which that scene's
            // hidden strip lies. (The ground given here is the surface itself: nothing stands
            // above it.)
            const samplecity::Dsm dsm(options);
            std::set<double> roof;
            for (size_t k = 0; k < source.size(); ++k) {
                const double x = options.west + (k % kSize + 0.5) * 0.5;
                const double y = options.south + options.sizeY - (k / kSize + 0.5) * 0.5;
                if (dsm.BuildingAt(x, y) != 0)
                    roof.insert(source[k]);
            }
            EXPECT_EQ(roof.size(), 1u);
        }
    }
}

// At equal levels the line of sight nearer the vertical wins: the northern camera north of the
// building, the southern one south of it. Without models the first scene wins. (The other
// rules are checked pixel by pixel on synthetic scenes below.)
// Blending does not depend on the tiles: multiband blending builds its pyramid on the mosaic
// grid (tiles whose origins are not on its cells give the same mosaic), and feathering reads
// each scene within the blend's reach of its region, whatever the tile cuts off.
TEST_F(OppositeViews, BlendedMosaicDoesNotDependOnTheTiles) {
    for (const auto blend : {RecoveryJob::Blend::Multiband, RecoveryJob::Blend::Feather}) {
        std::vector<std::vector<double>> mosaics;
        for (const unsigned int tile : {64u, 36u}) {
            RecoveryJob job = Job(1, 1, 1, true);
            job.seamlines = true, job.blendWidth = 16, job.blend = blend;
            job.tileSize = tile;
            ASSERT_TRUE(OcclusionRecovery().Recover(job).completed);
            mosaics.push_back(ReadBand(dir->File("mosaic.tif"), 2));
        }
        EXPECT_EQ(mosaics[0], mosaics[1]);
    }
}

// Byte orthos go from byte to byte where the seams are hard, and are read only within the
// blend's reach of their regions where feathered: the mosaic is the one that Float32 copies of
// them make, rounded (and moved off no-data as a Byte mosaic is), from the same regions.
TEST_F(OppositeViews, ByteOrthosMakeTheMosaicOfTheirFloat32Copies) {
    for (const char* name : {"view000", "view180"}) {
        std::unique_ptr<GDALDataset> byte(
            GDALDataset::Open(dir->File(std::string(name) + "_ortho.tif").c_str(), GDAL_OF_RASTER));
        ASSERT_TRUE(byte);
        const char* args[] = {"-ot", "Float32", nullptr};
        GDALTranslateOptions* translate =
            GDALTranslateOptionsNew(const_cast<char**>(args), nullptr);
        GDALClose(GDALTranslate(dir->File(std::string(name) + "_float.tif").c_str(), byte.get(),
                                translate, nullptr));
        GDALTranslateOptionsFree(translate);
    }
    const struct {
        bool seamlines;
        unsigned int blendWidth;
        RecoveryJob::Blend blend;
    } cases[] = {{false, 0, RecoveryJob::Blend::Feather},
                 {false, 16, RecoveryJob::Blend::Feather},
                 {true, 0, RecoveryJob::Blend::Feather},
                 {true, 16, RecoveryJob::Blend::Feather},
                 {true, 16, RecoveryJob::Blend::Multiband}};
    for (const auto& c : cases) {
        SCOPED_TRACE(testing::Message() << "seamlines " << c.seamlines << ", blend width "
                                        << c.blendWidth << ", multiband "
                                        << (c.blend == RecoveryJob::Blend::Multiband));
        std::vector<std::vector<double>> mosaics[2], sources;
        for (const bool asFloat : {false, true}) {
            RecoveryJob job = Job(1, 1, 1, true);
            job.seamlines = c.seamlines, job.blendWidth = c.blendWidth, job.blend = c.blend;
            if (asFloat)
                job.scenes[0].orthoPath = dir->File("view000_float.tif"),
                job.scenes[1].orthoPath = dir->File("view180_float.tif");
            ASSERT_TRUE(OcclusionRecovery().Recover(job).completed);
            for (int band = 1; band <= 3; ++band)
                mosaics[asFloat].push_back(ReadBand(job.mosaicPath, band));
            sources.push_back(ReadBand(job.sourcePath));
        }
        ASSERT_EQ(sources[0], sources[1]);
        size_t differences = 0;
        for (int band = 0; band < 3; ++band)
            for (size_t k = 0; k < sources[0].size(); ++k) {
                const double rounded = std::round(mosaics[1][band][k]);
                const double expected = sources[0][k] == 0 ? 0 : rounded == 0 ? 1 : rounded;
                differences += mosaics[0][band][k] != expected;
            }
        EXPECT_EQ(differences, 0u);
    }
}

// The seam source asked for some cells of a window reads them as a read of the whole window
// does, on windows whose chunks start off the angles' lattice; every other cell keeps which
// scenes may take it.
TEST_F(OppositeViews, SeamSourceReadsTheCellsAskedAsTheWholeWindow) {
    RecoveryJob job = Job(1, 1, 2, true);
    const trueortho::RecoveryGrid grid = trueortho::InspectScenes(job);
    job.surface->SetInputCRS(grid.crs.get());
    const trueortho::SceneReader reader(job, grid);
    trueortho::BalanceFit fit;
    fit.gain.assign(2, std::vector<double>(static_cast<size_t>(grid.bands), 1.1));
    fit.offset.assign(2, std::vector<double>(static_cast<size_t>(grid.bands), -3.0));
    trueortho::RunControl control(nullptr, nullptr, nullptr);
    const auto source = trueortho::MakeSeamSource(job, grid, reader, fit, control);
    for (const std::array<int, 4> at : {std::array<int, 4>{0, 0, 258, 258}, {37, 101, 203, 150}}) {
        const auto [x0, y0, w, h] = at;
        SCOPED_TRACE(::testing::Message() << "window at " << x0 << ", " << y0);
        const trueortho::SeamWindow whole = source->Read(x0, y0, w, h, 1);
        ASSERT_EQ(whole.scenes.size(), 2u);
        std::vector<std::uint8_t> needed(static_cast<size_t>(w) * h);
        for (int y = 0; y < h; ++y)
            for (int x = 0; x < w; ++x)  // diagonal bands and a lone corner
                needed[static_cast<size_t>(y) * w + x] = (x + 2 * y) % 97 < 9 || (x > 180 && y > 130);
        int asked = 0;
        const trueortho::SeamWindow part =
            source->Read(x0, y0, w, h, 1, [&](const trueortho::SeamWindow& allowed) {
                ++asked;
                EXPECT_EQ(allowed.scenes, whole.scenes);
                return needed;
            });
        ASSERT_EQ(asked, 1);
        ASSERT_EQ(part.scenes, whole.scenes);
        size_t differ = 0, allowedDiffer = 0, compared = 0;
        for (size_t k = 0; k < whole.scenes.size(); ++k)
            for (size_t c = 0; c < needed.size(); ++c) {
                const bool allowed = whole.cost[k][c] < trueortho::kForbidden;
                allowedDiffer += allowed != (part.cost[k][c] < trueortho::kForbidden);
                if (!needed[c] || !allowed)
                    continue;
                ++compared;
                differ += part.cost[k][c] != whole.cost[k][c] ||
                          part.grey[k][c] != whole.grey[k][c] || part.raised[c] != whole.raised[c];
            }
        EXPECT_EQ(allowedDiffer, 0u);
        EXPECT_EQ(differ, 0u);
        EXPECT_GT(compared, needed.size() / 10);
    }
}

TEST_F(OppositeViews, SteeperLineOfSightWinsAtEqualLevels) {
    const auto vis1 = Visibility(0), vis2 = Visibility(1);
    auto both = [&](size_t k) { return vis1[k] == VISIBILITY_SEEN && vis2[k] == VISIBILITY_SEEN; };
    for (const bool withModels : {true, false}) {
        ASSERT_TRUE(OcclusionRecovery().Recover(Job(1, 1, 0, withModels)).completed);
        const auto source = ReadBand(dir->File("source.tif"));
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
    const std::string refused = testsupport::ThrownMessage<kestrel::DataException>(
        [&] { OcclusionRecovery().Recover(job); });
    EXPECT_TRUE(testsupport::Contains(refused, "dsm.tif")) << refused;
    for (const char* name :
         {"mosaic.tif", "source.tif", "mosaic.tif.partial", "source.tif.partial"})
        EXPECT_FALSE(std::filesystem::exists(dir->File(name))) << name;
}

// A cancel while the seam step asks for the surface's heights (the ground's opening, in slices)
// ends the run there: after the slice at hand no height is asked for, nothing is published.
// Cancelled at the seam source's first read of surface heights (the ground's estimate) or at
// its last (a refinement window's, after it said which cells it needs): the read stops at the
// slice and the run leaves no output.
TEST_F(OppositeViews, CancelWhileSeamsReadHeightsStopsAtTheSlice) {
    struct Cancelling : samplecity::GridSurface {
        using GridSurface::GridSurface;
        bool* flag = nullptr;
        std::size_t cancelAt = 0;  // reads of several heights before cancelling; 0: never
        mutable std::atomic<std::size_t> reads{0}, cells{0};  // asked from the seam threads
        void GetHeights(std::size_t n, const double* x, const double* y,
                        double* h) const override {
            GridSurface::GetHeights(n, x, y, h);
            if (n > 1 && ++reads >= cancelAt && cancelAt > 0) {  // not a view angle's point
                cells += n;
                testsupport::RaiseCancelFlag(flag);
            }
        }
    } heights(dir->File("dsm.tif"));
    RecoveryJob job = Job(1, 1, 1, true);
    job.surface = &heights;
    job.seamlines = true;
    bool cancel = false;
    heights.flag = &cancel;
    ASSERT_TRUE(OcclusionRecovery().Recover(job).completed);
    const std::size_t all = heights.reads.load();
    for (const std::size_t at : {std::size_t{1}, all}) {
        SCOPED_TRACE(::testing::Message() << "cancelled at read " << at << " of " << all);
        cancel = false;
        heights.cancelAt = at, heights.reads = 0, heights.cells = 0;
        std::filesystem::remove(dir->File("mosaic.tif"));
        std::filesystem::remove(dir->File("source.tif"));
        OcclusionRecovery recovery;
        recovery.SetCancelFlag(&cancel);
        EXPECT_FALSE(recovery.Recover(job).completed);
        EXPECT_GT(heights.cells, 0u);
        EXPECT_LE(heights.cells, 2u * 4096u);  // a slice on each of two threads at the most
        for (const char* name : {"mosaic.tif", "source.tif"})
            EXPECT_FALSE(std::filesystem::exists(dir->File(name))) << name;
    }
}

// ---------------------------------------------------------------------------------------------
// Synthetic scenes: visibility indexes drawn at random, orthos of one value per scene.

namespace synthetic {

constexpr int kWidth = 70, kHeight = 50;
constexpr double kLeft = 500000, kTop = 4100000, kPixel = 0.5;

// A part of the common grid, in pixels.
struct Window {
    int x = 0, y = 0, width = kWidth, height = kHeight;
};

// Writes the window of a one-band raster (Byte unless said) on the common grid as a GeoTIFF of
// its own, origin `shift` pixels off the grid's lattice.
void WriteBand(const std::string& path, const std::vector<unsigned char>& values,
               const Window& w = Window(), double shift = 0, GDALDataType type = GDT_Byte) {
    GDALAllRegister();
    GDALDriver* gtiff = GetGDALDriverManager()->GetDriverByName("GTiff");
    std::unique_ptr<GDALDataset> ds(
        gtiff->Create(path.c_str(), w.width, w.height, 1, type, nullptr));
    const double gt[6] = {kLeft + (w.x + shift) * kPixel, kPixel, 0, kTop - w.y * kPixel, 0,
                          -kPixel};
    ds->SetGeoTransform(const_cast<double*>(gt));
    ds->GetRasterBand(1)->SetNoDataValue(0);
    unsigned char* start = const_cast<unsigned char*>(values.data()) + w.y * kWidth + w.x;
    ASSERT_EQ(ds->GetRasterBand(1)->RasterIO(GF_Write, 0, 0, w.width, w.height, start, w.width,
                                             w.height, GDT_Byte, 1, kWidth, nullptr),
              CE_None);
}

// Scene s: ortho value 10 * (s + 1); visibility seen, hidden (with probability `hidden`) or
// outside (with probability 0.1). With windows, scene s lies on windows[s] (outside it the
// visibility says outside) and is written twice: padded to the grid (the job returned) and
// cropped to its window ("sceneN_window_*.tif").
RecoveryJob MakeScenes(const TempDir& dir, int count, double hidden, unsigned seed,
                       std::vector<std::vector<unsigned char>>& visibility,
                       const std::vector<Window>& windows = {}) {
    std::mt19937 random(seed);
    std::uniform_real_distribution<double> draw(0.0, 1.0);
    RecoveryJob job;
    visibility.clear();
    for (int s = 0; s < count; ++s) {
        const std::string name = "scene" + std::to_string(s);
        const Window w = windows.empty() ? Window() : windows[s];
        std::vector<unsigned char> vis(kWidth * kHeight);
        for (int k = 0; k < kWidth * kHeight; ++k) {
            const double d = draw(random);
            const int x = k % kWidth, y = k / kWidth;
            const bool inside = x >= w.x && x < w.x + w.width && y >= w.y && y < w.y + w.height;
            vis[k] = !inside || (d >= hidden && d < hidden + 0.1) ? VISIBILITY_OUTSIDE
                     : d < hidden                                 ? VISIBILITY_HIDDEN
                                                                  : VISIBILITY_SEEN;
        }
        const std::vector<unsigned char> ortho(vis.size(), static_cast<unsigned char>(10 * (s + 1)));
        WriteBand(dir.File(name + "_vis.tif"), vis);
        WriteBand(dir.File(name + "_ortho.tif"), ortho);
        if (!windows.empty()) {
            WriteBand(dir.File(name + "_window_vis.tif"), vis, w);
            WriteBand(dir.File(name + "_window_ortho.tif"), ortho, w);
        }
        RecoveryScene scene;
        scene.orthoPath = dir.File(name + "_ortho.tif");
        scene.visibilityPath = dir.File(name + "_vis.tif");
        scene.radiometricLevel = s % 2;
        job.scenes.push_back(scene);
        visibility.push_back(vis);
    }
    job.mosaicPath = dir.File("mosaic.tif");
    job.sourcePath = dir.File("source.tif");
    job.tileSize = 16;
    job.seamlines = false, job.blendWidth = 0, job.balance = RecoveryJob::Balance::None;
    return job;
}

// The choice rules pixel by pixel, without models: seen clearly, then level, then order.
std::vector<double> ExpectedSource(const RecoveryJob& job,
                                   const std::vector<std::vector<unsigned char>>& visibility) {
    std::vector<double> source(kWidth * kHeight, 0);
    for (int y = 0; y < kHeight; ++y)
        for (int x = 0; x < kWidth; ++x) {
            std::tuple<int, int, size_t> best{2, 0, 0};
            for (size_t s = 0; s < job.scenes.size(); ++s) {
                const auto& vis = visibility[s];
                if (vis[y * kWidth + x] != VISIBILITY_SEEN)
                    continue;
                const int e = job.scenes[s].dbmPixelError;
                int unclear = 0;
                for (int j = std::max(0, y - e); j <= std::min(kHeight - 1, y + e); ++j)
                    for (int i = std::max(0, x - e); i <= std::min(kWidth - 1, x + e); ++i)
                        unclear |= vis[j * kWidth + i] == VISIBILITY_HIDDEN;
                best = std::min(best, std::make_tuple(unclear, job.scenes[s].radiometricLevel, s));
            }
            if (std::get<0>(best) < 2)
                source[y * kWidth + x] = static_cast<double>(std::get<2>(best) + 1);
        }
    return source;
}

}  // namespace synthetic

// The choice rules at every pixel: seen clearly (the pixel-error neighbourhood, across tile
// borders, for errors from none to far beyond the grid, whose cost per pixel once grew with the
// square of the error, and scenes whose errors differ), then the radiometric level, then order;
// visibility indexes of another type than Byte read alike.
TEST(RecoveryChoice, PixelErrorNeighbourhoodMatchesTheRuleAtEveryPixel) {
    const struct {
        std::vector<int> errors;
        double hidden;
        GDALDataType visibilityType;
    } cases[] = {{{0, 0, 0}, 0.05, GDT_Byte},
                 {{1, 1, 1}, 0.02, GDT_Byte},
                 {{3, 0, 2}, 0.01, GDT_Byte},
                 {{3, 0, 2}, 0.1, GDT_Float32},
                 {{17, 5, 40}, 0.002, GDT_Byte},
                 {{1000, 1000}, 0.0005, GDT_Byte}};
    unsigned seed = 1;
    for (const auto& c : cases) {
        SCOPED_TRACE(::testing::Message() << "errors " << c.errors[0] << ", hidden " << c.hidden);
        TempDir dir;
        std::vector<std::vector<unsigned char>> visibility;
        RecoveryJob job = synthetic::MakeScenes(dir, static_cast<int>(c.errors.size()), c.hidden,
                                                seed++, visibility);
        for (size_t s = 0; s < job.scenes.size(); ++s) {
            job.scenes[s].dbmPixelError = c.errors[s];
            if (c.visibilityType != GDT_Byte)
                synthetic::WriteBand(job.scenes[s].visibilityPath, visibility[s],
                                     synthetic::Window(), 0, c.visibilityType);
        }
        const TorthoRecoveryResult result = OcclusionRecovery().Recover(job);
        ASSERT_TRUE(result.completed);
        const auto expected = synthetic::ExpectedSource(job, visibility);
        const auto source = ReadBand(job.sourcePath);
        const auto mosaic = ReadBand(job.mosaicPath);
        ASSERT_EQ(source.size(), expected.size());
        unsigned long long filled = 0;
        for (size_t k = 0; k < source.size(); ++k) {
            ASSERT_EQ(source[k], expected[k])
                << "pixel " << k % synthetic::kWidth << ", line " << k / synthetic::kWidth;
            ASSERT_EQ(mosaic[k], 10 * source[k]) << k;
            filled += source[k] > 0;
        }
        EXPECT_EQ(result.filled, filled);
        EXPECT_EQ(result.filled + result.unfilled, source.size());
    }
}

// Many scenes on many threads under a small limit of open files, and a thread count far beyond
// the work: the threads share each scene's rasters, more scenes than stay open at once (closed
// and opened again as tiles need them), and threads are capped by the tiles. The mosaic, a COG
// compressed on the run's threads, is the same file on one thread.
TEST(RecoveryChoice, ThreadsShareEachScenesFilesAndAreCappedByTheWork) {
    TempDir dir;
    std::vector<std::vector<unsigned char>> visibility;
    RecoveryJob job = synthetic::MakeScenes(dir, 70, 0.01, 7, visibility);
    job.format = "COG";
    const auto expected = synthetic::ExpectedSource(job, visibility);
#if !defined(_WIN32)
    rlimit saved{};
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &saved), 0);
    rlimit limited = saved;
    limited.rlim_cur = std::min<rlim_t>(saved.rlim_cur, 1024);
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &limited), 0);
#endif
    std::string oneThread;
    for (const unsigned int threads : {1u, 16u, 4000000000u}) {
        SCOPED_TRACE(threads);
        GeneratorSettings settings;
        settings.threadCount = threads;
        std::filesystem::remove(job.sourcePath);
        std::filesystem::remove(job.mosaicPath);
        EXPECT_TRUE(OcclusionRecovery(settings).Recover(job).completed);
        EXPECT_EQ(ReadBand(job.sourcePath), expected);
        const std::string mosaic = testsupport::ReadFile(job.mosaicPath);
        if (threads == 1)
            oneThread = mosaic;
        EXPECT_TRUE(mosaic == oneThread);
    }
#if !defined(_WIN32)
    setrlimit(RLIMIT_NOFILE, &saved);
#endif
}

// Scenes on windows of the grid (the pixel-error neighbourhood meeting the windows' edges) give
// the mosaic of the same scenes padded to the whole grid; each tile reads only the scenes whose
// window meets it; without a grid the mosaic is the union of the windows; a scene off the
// lattice is refused, naming both files.
TEST(RecoveryWindows, ScenesOnWindowsGiveTheMosaicOfTheScenesPaddedToTheGrid) {
    using synthetic::kHeight;
    using synthetic::kWidth;
    const std::vector<synthetic::Window> windows = {
        {3, 2, 37, 28}, {25, 10, 40, 38}, {5, 20, 30, 28}, {44, 0, 21, 12}};
    TempDir dir;
    std::vector<std::vector<unsigned char>> visibility;
    RecoveryJob padded = synthetic::MakeScenes(dir, 4, 0.03, 11, visibility, windows);
    const int errors[] = {2, 0, 3, 1};
    for (size_t s = 0; s < padded.scenes.size(); ++s)
        padded.scenes[s].dbmPixelError = errors[s];
    ASSERT_TRUE(OcclusionRecovery().Recover(padded).completed);
    const auto source = ReadBand(padded.sourcePath), mosaic = ReadBand(padded.mosaicPath);
    ASSERT_EQ(source, synthetic::ExpectedSource(padded, visibility));

    RecoveryJob cropped = padded;
    for (size_t s = 0; s < cropped.scenes.size(); ++s) {
        const std::string name = "scene" + std::to_string(s) + "_window_";
        cropped.scenes[s].orthoPath = dir.File(name + "ortho.tif");
        cropped.scenes[s].visibilityPath = dir.File(name + "vis.tif");
    }
    cropped.mosaicPath = dir.File("cropped.tif");
    cropped.sourcePath = dir.File("cropped_source.tif");
    cropped.geocoding = kestrel::ogc::cs::GeocodingInfo::NorthUp(
        synthetic::kLeft, synthetic::kTop, synthetic::kPixel, synthetic::kPixel);
    cropped.pixels = kWidth, cropped.lines = kHeight;
    const TorthoRecoveryResult result = OcclusionRecovery().Recover(cropped);
    ASSERT_TRUE(result.completed);
    EXPECT_EQ(ReadBand(cropped.sourcePath), source);
    EXPECT_EQ(ReadBand(cropped.mosaicPath), mosaic);
    unsigned long long reads = 0;  // tiles of 16 times the windows meeting each
    for (int ty = 0; ty < kHeight; ty += 16)
        for (int tx = 0; tx < kWidth; tx += 16)
            for (const auto& w : windows)
                reads += w.x < tx + 16 && tx < w.x + w.width && w.y < ty + 16 && ty < w.y + w.height;
    EXPECT_EQ(result.sceneReads, reads);
    EXPECT_LT(reads, 20u * windows.size());

    // The union of the windows: pixels 3 to 64, lines 0 to 47.
    cropped.pixels = cropped.lines = 0;
    ASSERT_TRUE(OcclusionRecovery().Recover(cropped).completed);
    {
        std::unique_ptr<GDALDataset> ds(GDALDataset::Open(cropped.sourcePath.c_str()));
        ASSERT_TRUE(ds);
        ASSERT_EQ(ds->GetRasterXSize(), 62);
        ASSERT_EQ(ds->GetRasterYSize(), 48);
        double gt[6];
        ASSERT_EQ(ds->GetGeoTransform(gt), CE_None);
        EXPECT_DOUBLE_EQ(gt[0], synthetic::kLeft + 3 * synthetic::kPixel);
        EXPECT_DOUBLE_EQ(gt[3], synthetic::kTop);
    }
    const auto unionSource = ReadBand(cropped.sourcePath);
    for (int y = 0; y < 48; ++y)
        for (int x = 0; x < 62; ++x)
            ASSERT_EQ(unionSource[y * 62 + x], source[y * kWidth + x + 3]) << x << ", " << y;

    synthetic::WriteBand(dir.File("shifted.tif"), visibility[1], windows[1], 0.25);
    cropped.scenes[1].orthoPath = dir.File("shifted.tif");
    const std::string what = testsupport::ThrownMessage<kestrel::DataException>(
        [&] { OcclusionRecovery().Recover(cropped); });
    EXPECT_TRUE(testsupport::Contains(what, "shifted.tif") &&
                testsupport::Contains(what, "scene0_window_ortho.tif"))
        << what;
}

// A regions raster names each pixel's scene; where that scene does not see the pixel, and where
// the raster says 0, the first-ranked scene fills it. A value that names no scene is refused,
// naming the raster. A tile whose pixels the named scenes see (or the mask leaves out) reads no
// other scene.
TEST(RecoveryRegions, TheRegionsRasterChoosesWhereItsSceneSees) {
    TempDir dir;
    std::vector<std::vector<unsigned char>> visibility;
    RecoveryJob job = synthetic::MakeScenes(dir, 3, 0.05, 5, visibility);
    for (auto& scene : job.scenes)
        scene.dbmPixelError = 1;
    std::vector<unsigned char> regions(visibility[0].size());
    for (size_t k = 0; k < regions.size(); ++k)
        regions[k] = static_cast<unsigned char>((k % synthetic::kWidth / 20 + k / synthetic::kWidth / 10) % 4);
    synthetic::WriteBand(dir.File("regions.tif"), regions);
    job.regionsPath = dir.File("regions.tif");
    ASSERT_TRUE(OcclusionRecovery().Recover(job).completed);
    auto expected = synthetic::ExpectedSource(job, visibility);
    size_t named = 0;
    for (size_t k = 0; k < expected.size(); ++k)
        if (regions[k] > 0 && visibility[regions[k] - 1][k] == VISIBILITY_SEEN)
            expected[k] = regions[k], ++named;
    EXPECT_GT(named, expected.size() / 2);
    const auto source = ReadBand(job.sourcePath), mosaic = ReadBand(job.mosaicPath);
    ASSERT_EQ(source, expected);
    for (size_t k = 0; k < source.size(); ++k)
        ASSERT_EQ(mosaic[k], 10 * source[k]) << k;

    regions[30 * synthetic::kWidth + 7] = 4;
    synthetic::WriteBand(dir.File("regions.tif"), regions);
    const std::string what = testsupport::ThrownMessage<kestrel::DataException>(
        [&] { OcclusionRecovery().Recover(job); });
    EXPECT_TRUE(testsupport::Contains(what, "regions.tif holds 4 at pixel 7, line 30")) << what;

    // Scene 1 sees every pixel and holds the region left of pixel 40; the mask leaves out the
    // rest: each 16-pixel tile reads scene 1 alone, or nothing where it is all masked out.
    std::vector<unsigned char> inside(regions.size());
    for (size_t k = 0; k < regions.size(); ++k)
        inside[k] = k % synthetic::kWidth < 40;
    synthetic::WriteBand(dir.File("scene0_vis.tif"),
                         std::vector<unsigned char>(regions.size(), VISIBILITY_SEEN));
    synthetic::WriteBand(dir.File("regions.tif"), inside);
    synthetic::WriteBand(dir.File("mask.tif"), inside);
    job.maskPath = dir.File("mask.tif");
    const TorthoRecoveryResult result = OcclusionRecovery().Recover(job);
    ASSERT_TRUE(result.completed);
    EXPECT_EQ(ReadBand(job.sourcePath), std::vector<double>(inside.begin(), inside.end()));
    const unsigned long long tilesAcross = (synthetic::kWidth + 15) / 16,
                             tilesDown = (synthetic::kHeight + 15) / 16;
    EXPECT_EQ(result.sceneReads, (40 + 15) / 16 * tilesDown);
    EXPECT_LT(result.sceneReads, tilesAcross * tilesDown);
}

// Two scenes of one texture t, the second exposed 1.2 t + 5, on overlapping windows: balanced,
// the whole mosaic (seamlines, blending) is one linear function of t within rounding; without
// the balance it is not. Progress over the three steps only goes forward.
TEST(RecoveryBalance, TwoExposuresMakeOneMosaicWithoutAStep) {
    using synthetic::kWidth;
    TempDir dir;
    const std::vector<synthetic::Window> windows = {{0, 0, 45, 50}, {25, 0, 45, 50}};
    // Byte orthos, and Float32 ones (read and balanced without the table of byte values).
    for (const GDALDataType type : {GDT_Byte, GDT_Float32}) {
        SCOPED_TRACE(GDALGetDataTypeName(type));
        std::vector<double> texture(kWidth * synthetic::kHeight);
        for (size_t k = 0; k < texture.size(); ++k)
            texture[k] = 40 + (k % kWidth * 7 + k / kWidth * 13) % 120;
        RecoveryJob job;
        for (int s = 0; s < 2; ++s) {
            std::vector<unsigned char> ortho(texture.size());
            for (size_t k = 0; k < ortho.size(); ++k)
                ortho[k] = static_cast<unsigned char>(
                    std::lround(s == 0 ? texture[k] : 1.2 * texture[k] + 5));
            const std::string name = "exposure" + std::to_string(s);
            synthetic::WriteBand(dir.File(name + "_ortho.tif"), ortho, windows[s], 0, type);
            synthetic::WriteBand(dir.File(name + "_vis.tif"),
                                 std::vector<unsigned char>(ortho.size(), VISIBILITY_SEEN),
                                 windows[s]);
            RecoveryScene scene;
            scene.orthoPath = dir.File(name + "_ortho.tif");
            scene.visibilityPath = dir.File(name + "_vis.tif");
            job.scenes.push_back(scene);
        }
        job.mosaicPath = dir.File("mosaic.tif");
        job.sourcePath = dir.File("source.tif");
        job.tileSize = 16;
        for (const auto balance : {RecoveryJob::Balance::GainOffset, RecoveryJob::Balance::None}) {
            job.balance = balance;
            std::vector<double> fractions;
            OcclusionRecovery recovery;
            recovery.SetProgress(
                [](double fraction, const char*, void* data) {
                    static_cast<std::vector<double>*>(data)->push_back(fraction);
                    return true;
                },
                &fractions);
            const TorthoRecoveryResult result = recovery.Recover(job);
            ASSERT_TRUE(result.completed);
            EXPECT_TRUE(std::is_sorted(fractions.begin(), fractions.end()));
            EXPECT_EQ(fractions.back(), 1.0);
            ASSERT_EQ(result.gain.size(), 2u);
            const auto mosaic = ReadBand(job.mosaicPath);
            // The least-squares line of the mosaic against t, and the largest residual.
            double n = 0, st = 0, sm = 0, stt = 0, stm = 0;
            for (size_t k = 0; k < mosaic.size(); ++k)
                n += 1, st += texture[k], sm += mosaic[k], stt += texture[k] * texture[k],
                    stm += texture[k] * mosaic[k];
            const double a = (n * stm - st * sm) / (n * stt - st * st), b = (sm - a * st) / n;
            double worst = 0;
            for (size_t k = 0; k < mosaic.size(); ++k)
                worst = std::max(worst, std::fabs(mosaic[k] - (a * texture[k] + b)));
            if (balance == RecoveryJob::Balance::None) {
                EXPECT_GT(worst, 10);
                EXPECT_EQ(result.gain[1][0], 1.0);
            } else {
                EXPECT_LE(worst, 1.5);
                EXPECT_NEAR(result.gain[0][0] / result.gain[1][0], 1.2, 0.01);
            }
        }
        // Orthos of one fine texture a pixel apart (as resampling and misregistration leave them):
        // the fit still finds the exposures, not a gain of the pixel-to-pixel noise.
        for (size_t k = 0; k < texture.size(); ++k) {
            unsigned long long h = (k + 1) * 0x9E3779B97F4A7C15ull;
            h ^= h >> 31, h *= 0xBF58476D1CE4E5B9ull, h ^= h >> 29;
            texture[k] = 40 + static_cast<double>(h % 120);
        }
        for (int s = 0; s < 2; ++s) {
            std::vector<unsigned char> ortho(texture.size());
            for (size_t k = 0; k < ortho.size(); ++k) {
                const size_t from = s == 0 || (k + 1) % kWidth == 0 ? k : k + 1;
                ortho[k] = static_cast<unsigned char>(
                    std::lround(s == 0 ? texture[from] : 1.2 * texture[from] + 5));
            }
            synthetic::WriteBand(job.scenes[s].orthoPath, ortho, windows[s], 0, type);
        }
        job.balance = RecoveryJob::Balance::GainOffset;
        const TorthoRecoveryResult result = OcclusionRecovery().Recover(job);
        ASSERT_TRUE(result.completed);
        EXPECT_NEAR(result.gain[0][0] / result.gain[1][0], 1.2, 0.03);
    }
}

// A pixel a scene sees whose value is the no-data value is filled with the nearest other value,
// not left for empty.
TEST(RecoveryChoice, ASeenPixelAtTheNoDataValueStaysFilled) {
    TempDir dir;
    std::vector<std::vector<unsigned char>> visibility;
    RecoveryJob job = synthetic::MakeScenes(dir, 1, 0.0, 3, visibility);
    std::vector<unsigned char> ortho(visibility[0].size(), 10);
    ortho[0] = ortho[1] = 0;
    visibility[0][0] = visibility[0][1] = VISIBILITY_SEEN;
    visibility[0][2] = VISIBILITY_OUTSIDE;
    synthetic::WriteBand(job.scenes[0].orthoPath, ortho);
    synthetic::WriteBand(job.scenes[0].visibilityPath, visibility[0]);
    const TorthoRecoveryResult result = OcclusionRecovery().Recover(job);
    ASSERT_TRUE(result.completed);
    const auto mosaic = ReadBand(job.mosaicPath), source = ReadBand(job.sourcePath);
    EXPECT_EQ(mosaic[0], 1);
    EXPECT_EQ(mosaic[1], 1);
    EXPECT_EQ(source[0], 1);
    EXPECT_EQ(mosaic[2], 0);
    EXPECT_EQ(source[2], 0);
    size_t seen = 0;
    for (const unsigned char v : visibility[0])
        seen += v == VISIBILITY_SEEN;
    EXPECT_EQ(result.filled, seen);
}

}  // namespace
