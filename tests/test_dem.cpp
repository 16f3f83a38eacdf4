// Raster DEMs: bilinear heights between posts and no-data left out, files, directories and tile
// indexes alike, the block cache under threads, constant DEMs, vertical datum conversion against
// PROJ's own answers, height ranges and holes of a window, and the errors for inputs that
// cannot be used (remote tiles included).
#include <kestrel/dem.h>

#include "demdata.h"
#include "support.h"

#include <cmath>
#include <filesystem>
#include <memory>
#include <random>
#include <thread>

#include <ogrsf_frmts.h>

using namespace kestrel::ogc::cs;
using namespace kestrel::dem;
using testsupport::Grid;

namespace {

// 300 x 260 posts of 10 m in UTM 32N with EGM96 heights, in 128 x 128 tiles. The heights are
// bilinear in the post indices, so that the bilinear value is known everywhere.
const Grid kGrid{514000, 5035000, 10, 300, 260};
const char* const kCrs = "EPSG:32632+5773";

double Surface(double i, double j) {
    return 100 + 0.5 * i + 0.25 * j + 0.001 * i * j;
}
float Post(int i, int j) {
    return static_cast<float>(Surface(i, j));
}
double At(double x, double y) {
    return Surface((x - kGrid.left) / kGrid.step - 0.5, (kGrid.top - y) / kGrid.step - 0.5);
}

const std::vector<std::string> kTiled = {"TILED=YES", "BLOCKXSIZE=128", "BLOCKYSIZE=128"};

std::unique_ptr<IRasterDEM> Open(const std::string& path, int cacheMegabytes = 10,
                                 bool preload = false, DatumType datum = DatumMSL) {
    return std::unique_ptr<IRasterDEM>(
        DEMFactory::CreateFileRasterDEM(path, 1, 0.0, 1.0, NAN, datum, preload, cacheMegabytes));
}

// Random points over the grid's extent and a little beyond.
void RandomPoints(std::size_t n, std::vector<double>& x, std::vector<double>& y) {
    std::mt19937 random(7);
    std::uniform_real_distribution<double> u(-0.02, 1.02);
    x.resize(n), y.resize(n);
    for (std::size_t k = 0; k < n; ++k) {
        x[k] = kGrid.left + u(random) * kGrid.width * kGrid.step;
        y[k] = kGrid.top - u(random) * kGrid.height * kGrid.step;
    }
}

bool Inside(double x, double y) {
    return x >= kGrid.left && x <= kGrid.left + kGrid.width * kGrid.step && y <= kGrid.top &&
           y >= kGrid.top - kGrid.height * kGrid.step;
}

// Within the posts' hull a height is the bilinear surface; in the rim of half a post around it,
// the nearest posts' blend; outside the raster, none.
void ExpectSurface(const std::vector<double>& x, const std::vector<double>& y,
                   const std::vector<double>& h) {
    for (std::size_t k = 0; k < x.size(); ++k) {
        const double i = (x[k] - kGrid.left) / kGrid.step - 0.5;
        const double j = (kGrid.top - y[k]) / kGrid.step - 0.5;
        if (!Inside(x[k], y[k])) {
            EXPECT_TRUE(std::isnan(h[k])) << k;
        } else {
            const double ci = std::clamp(i, 0.0, kGrid.width - 1.0);
            const double cj = std::clamp(j, 0.0, kGrid.height - 1.0);
            // Single precision posts: about 1e-5 relative.
            ASSERT_NEAR(h[k], Surface(ci, cj), 2e-4) << k << " at " << x[k] << ", " << y[k];
        }
    }
}

class Dem : public ::testing::Test {
  protected:
    void SetUp() override {
        path = dir.File("dem.tif");
        testsupport::WriteDem(path, kGrid, kCrs, Post, kTiled);
    }
    testsupport::TempDir dir;
    std::string path;
};

}  // namespace

TEST_F(Dem, GridOfTheRasterAndBilinearBetweenPostsWhateverTheCacheOrBatch) {
    std::vector<double> x, y;
    RandomPoints(20000, x, y);
    // Preloaded, cached with room for every block, and with room for one block only.
    std::unique_ptr<IRasterDEM> dems[] = {Open(path, 10, true), Open(path, 10), Open(path, 1)};
    for (auto& dem : dems) {
        EXPECT_EQ(dem->GetWidth(), 300u);
        EXPECT_EQ(dem->GetHeight(), 260u);
        EXPECT_EQ(dem->GetVerticalDatum(), DatumMSL);
        double extent[4];
        dem->GetExtent(extent[0], extent[1], extent[2], extent[3]);
        EXPECT_EQ(std::vector<double>(extent, extent + 4),
                  (std::vector<double>{514000, 5032400, 517000, 5035000}));
        EXPECT_EQ(dem->GetGeocoding()->GetGeoTransform(), kGrid.Transform());
        EXPECT_TRUE(dem->GetCRS()->IsSame(ICRS(kCrs)));
        std::vector<double> h(x.size());
        dem->GetHeights(x.size(), x.data(), y.data(), h.data());
        ExpectSurface(x, y, h);
        // One point at a time gives the same.
        for (std::size_t k = 0; k < 300; ++k) {
            double single = NAN;
            EXPECT_EQ(dem->GetHeight(x[k], y[k], single), !std::isnan(h[k]));
            EXPECT_TRUE(std::isnan(h[k]) || single == h[k]);
        }
    }
}

TEST_F(Dem, ConcurrentQueriesOnOneObjectAgree) {
    auto dem = Open(path, 1);
    std::vector<double> x, y;
    RandomPoints(4000, x, y);
    std::vector<double> expected(x.size());
    dem->GetHeights(x.size(), x.data(), y.data(), expected.data());
    std::vector<std::vector<double>> results(4, std::vector<double>(x.size()));
    std::vector<std::thread> threads;
    for (std::size_t t = 0; t < results.size(); ++t) {
        threads.emplace_back([&, t] {
            // Single points and small batches, so that the threads share the cache often.
            for (std::size_t k = 0; k < x.size(); k += 50)
                dem->GetHeights(std::min<std::size_t>(t + 1, x.size() - k), &x[k], &y[k],
                                &results[t][k]);
        });
    }
    for (auto& th : threads)
        th.join();
    for (std::size_t t = 0; t < results.size(); ++t)
        for (std::size_t k = 0; k < x.size(); k += 50)
            for (std::size_t m = k; m < std::min(k + t + 1, x.size()); ++m)
                ASSERT_TRUE(results[t][m] == expected[m] ||
                            (std::isnan(results[t][m]) && std::isnan(expected[m])));
}

TEST(DemNoData, HolesAreNeverAveragedIn) {
    testsupport::TempDir dir;
    const Grid grid{0, 40, 10, 4, 4};
    const std::string path = dir.File("holes.tif");
    // Post (1, 1) is a hole; post (2, 2) holds the extra no-data value 7; posts (3, 3) and
    // (0, 3) are infinite.
    testsupport::WriteDem(
        path, grid, "EPSG:32632",
        [](int i, int j) {
            return i == 1 && j == 1   ? -32768.0f
                   : i == 2 && j == 2 ? 7.0f
                   : i == 3 && j == 3 ? INFINITY
                   : i == 0 && j == 3 ? -INFINITY
                                      : 100.0f + i;
        },
        {}, true);
    std::unique_ptr<IRasterDEM> dem(
        DEMFactory::CreateFileRasterDEM(path, 0, 5.0, 2.0, 7.0f, DatumMSL, false, 1));
    const struct {
        double x, y, h;
    } cases[] = {
        {grid.X(1), grid.Y(1), NAN},              // on the hole
        {grid.X(2), grid.Y(2), NAN},              // on the extra no-data post
        {grid.X(0.5), grid.Y(1), 5 + 2 * 100.0},  // halfway to the hole: its neighbour only
        {grid.X(1.5), grid.Y(0), 5 + 2 * 101.5},  // between two posts with heights
        {grid.X(0.25), grid.Y(0.25),
         5 + 2 * (100 * 0.75 * 0.75 + 101 * 0.25 * 0.75 + 100 * 0.75 * 0.25) / (1 - 0.0625)},
        {-1, 20, NAN},                            // outside
        {0, 40, 5 + 2 * 100.0},                   // the raster's corner
        {grid.X(3), grid.Y(3), NAN},              // on an infinite post: no-data
        {grid.X(2.5), grid.Y(3), 5 + 2 * 102.0},  // beside it: its neighbour only
        {grid.X(0.5), grid.Y(3), 5 + 2 * 101.0},
    };
    // Four posts without a height: the hole, the extra no-data value and the infinite ones.
    std::size_t posts = 0, holes = 0;
    ASSERT_TRUE(dem->CountPosts(0, 0, 40, 40, posts, holes));
    EXPECT_EQ(posts, 16u);
    EXPECT_EQ(holes, 4u);
    ASSERT_TRUE(dem->CountPosts(grid.X(0.9), grid.Y(3.5), grid.X(3), grid.Y(2.1), posts, holes));
    EXPECT_EQ(posts, 3u);  // (1, 3), (2, 3), (3, 3)
    EXPECT_EQ(holes, 1u);
    for (const auto& c : cases) {
        double h = NAN;
        dem->GetHeights(1, &c.x, &c.y, &h);
        if (std::isnan(c.h))
            EXPECT_TRUE(std::isnan(h)) << c.x << ", " << c.y << ": " << h;
        else
            EXPECT_NEAR(h, c.h, 1e-9) << c.x << ", " << c.y;
    }
}

TEST_F(Dem, DirectoryAndTileIndexMosaicTheirTiles) {
    // Four tiles of the DEM in a directory (with a file that is no raster), and a tile index
    // of them made by gdaltindex.
    const std::string tiles = dir.File("tiles");
    std::filesystem::create_directory(tiles);
    testsupport::WriteFile(tiles + "/readme.txt", "not a raster");
    std::string names;
    for (int t = 0; t < 4; ++t) {
        const int x0 = (t % 2) * 150, y0 = (t / 2) * 130;
        const Grid tile{kGrid.left + x0 * kGrid.step, kGrid.top - y0 * kGrid.step, kGrid.step, 150,
                        130};
        const std::string name = "t" + std::to_string(t) + ".tif";
        testsupport::WriteDem(tiles + "/" + name, tile, kCrs,
                              [&](int i, int j) { return Post(i + x0, j + y0); });
        names += " " + name;
    }
    const std::string index = tiles + "/index.gpkg";
    testsupport::RunCommand("cd '" + tiles + "' && gdaltindex -f GPKG index.gpkg" + names +
                            " >/dev/null");
    ASSERT_TRUE(DEMFactory::IsTileRasterDEMFile(index));
    EXPECT_FALSE(DEMFactory::IsTileRasterDEMFile(path));
    EXPECT_FALSE(DEMFactory::IsTileRasterDEMFile(tiles));
    EXPECT_FALSE(DEMFactory::IsTileRasterDEMFile(dir.File("missing.gpkg")));

    std::vector<double> x, y;
    RandomPoints(5000, x, y);
    std::unique_ptr<IRasterDEM> tiled(DEMFactory::CreateTileRasterDEM(index));
    EXPECT_EQ(tiled->GetVerticalDatum(), DatumMSL);  // from its CRS
    std::unique_ptr<IRasterDEM> dems[] = {Open(tiles), std::move(tiled)};
    for (auto& dem : dems) {
        std::vector<double> h(x.size());
        dem->GetHeights(x.size(), x.data(), y.data(), h.data());
        ExpectSurface(x, y, h);
    }
}

// A tile index carries its own datum (its layer's VERTICAL_DATUM item) and names local files
// only: a remote or missing tile is refused naming the index, the feature and the location.
TEST_F(Dem, TileIndexCarriesItsOwnDatumAndNamesOnlyLocalFiles) {
    const std::string index = dir.File("index.gpkg");
    testsupport::RunCommand("cd '" + dir.Path().string() +
                            "' && gdaltindex -f GPKG index.gpkg dem.tif >/dev/null");
    const auto openIndex = [&] {
        return GDALDatasetUniquePtr(
            GDALDataset::Open(index.c_str(), GDAL_OF_VECTOR | GDAL_OF_UPDATE));
    };
    for (const char* keyword : {"MATHMODEL", "ellipsoid", "MSL"}) {
        openIndex()->GetLayer(0)->SetMetadataItem("VERTICAL_DATUM", keyword);
        std::unique_ptr<IRasterDEM> dem(DEMFactory::CreateTileRasterDEM(index));
        const DatumType expected = keyword[0] == 'M' && keyword[1] == 'A' ? DatumMathModel
                                   : keyword[0] == 'e'                    ? DatumEllipsoid
                                                                          : DatumMSL;
        EXPECT_EQ(dem->GetVerticalDatum(), expected) << keyword;
        EXPECT_EQ(dem->GetOutputVerticalDatum(), expected) << keyword;
    }
    for (const char* location : {"/vsicurl/http://example.com/dem.tif", "https://example.com/t.tif",
                                 "/vsizip/tiles.zip/dem.tif", "missing.tif"}) {
        {
            const GDALDatasetUniquePtr ds = openIndex();
            OGRLayer* tiles = ds->GetLayer(0);
            tiles->ResetReading();
            std::unique_ptr<OGRFeature> second(
                std::unique_ptr<OGRFeature>(tiles->GetNextFeature())->Clone());
            second->SetFID(2);
            second->SetField("location", location);
            ASSERT_EQ(std::unique_ptr<OGRFeature>(tiles->GetFeature(2))
                          ? tiles->SetFeature(second.get())
                          : tiles->CreateFeature(second.get()),
                      OGRERR_NONE);
        }
        const std::string message = testsupport::ThrownMessage<kestrel::DataException>(
            [&] { delete DEMFactory::CreateTileRasterDEM(index); }, location);
        for (const std::string& part : {index, std::string("feature 2"), std::string(location),
                                        std::string("not a local file")})
            EXPECT_TRUE(testsupport::Contains(message, part)) << message;
    }
}

// The height range of a window holds every height in it, in any input CRS and output datum,
// and is that of the window's own posts: a far outlier or an infinite post elsewhere does not
// widen it.
TEST_F(Dem, HeightRangeOfAWindow) {
    const std::string outliers = dir.File("outliers.tif");
    testsupport::WriteDem(
        outliers, kGrid, kCrs,
        [](int i, int j) {
            return i == 290 && j == 250 ? 1e6f : i == 20 && j == 20 ? INFINITY : Post(i, j);
        },
        kTiled);
    const ICRS webMercator("EPSG:3857");
    const struct {
        bool mercator;          // the window in EPSG:3857, else the DEM's own CRS
        DatumType output;       // the datum of the heights
        double i0, j0, i1, j1;  // the window, in post coordinates
        bool holdsOutlier;
    } cases[] = {
        {false, DatumMSL, 10, 10, 30, 25, false},
        {false, DatumMSL, 100.3, 50.2, 104.8, 53.9, false},
        {true, DatumEllipsoid, 150, 120, 170, 140, false},
        {false, DatumEllipsoid, 280, 240, 299, 259, true},
    };
    for (bool preload : {false, true}) {
        auto dem = Open(outliers, 1, preload);
        for (const auto& c : cases) {
            SCOPED_TRACE(c.i0);
            dem->SetOutputVerticalDatum(c.output);
            dem->SetInputCRS(c.mercator ? &webMercator : nullptr);
            // Dense points of the window, in the input CRS.
            std::vector<double> x, y;
            for (int b = 0; b <= 20; ++b)
                for (int a = 0; a <= 20; ++a)
                    x.push_back(kGrid.X(c.i0 + (c.i1 - c.i0) * a / 20)),
                        y.push_back(kGrid.Y(c.j0 + (c.j1 - c.j0) * b / 20));
            if (c.mercator)
                CoordinateTransformation(ICRS(kCrs), webMercator)
                    .Transform(x.size(), x.data(), y.data());
            std::vector<double> h(x.size());
            dem->GetHeights(x.size(), x.data(), y.data(), h.data());
            const auto [x0, x1] = std::minmax_element(x.begin(), x.end());
            const auto [y0, y1] = std::minmax_element(y.begin(), y.end());
            double low = NAN, high = NAN;
            ASSERT_TRUE(dem->GetHeightRange(*x0, *y0, *x1, *y1, low, high));
            for (double v : h) {
                if (!std::isnan(v)) {
                    EXPECT_TRUE(low <= v && v <= high) << low << " " << v << " " << high;
                }
            }
            if (c.holdsOutlier) {
                EXPECT_GE(high, 1e6);
            } else {
                // Cells of 16 posts: a little wider than the window's own heights.
                const auto [hl, hh] = std::minmax_element(h.begin(), h.end());
                EXPECT_GT(low, *hl - 30);
                EXPECT_LT(high, *hh + 30);
            }
        }
        dem->SetInputCRS(nullptr);
        double low, high;
        EXPECT_FALSE(dem->GetHeightRange(0, 0, 10, 10, low, high));  // far outside
    }
}

// Reference heights from PROJ's command line (heights above the WGS 84 ellipsoid):
//   printf "515000 5034000 184.52525\n516123.4 5033210.7 288.3261112\n" |
//     cs2cs -d 6 EPSG:32632+5773 EPSG:4979        -> 227.038653, 330.774884
//   printf "515000 5034000 120\n" | cs2cs -d 6 EPSG:32632+5773 EPSG:4979      -> 162.513403
//   printf "45.46 9.19 120\n" | cs2cs -d 6 EPSG:4326+5773 EPSG:4979           -> 162.519972
//   printf "515000 5034000 200\n" | cs2cs -d 6 EPSG:32632+4979 EPSG:32632+5773 -> 157.486597
TEST_F(Dem, MeanSeaLevelAndEllipsoidHeightsAsPROJConvertsThem) {
    const double x[] = {515000, 516123.4}, y[] = {5034000, 5033210.7};
    EXPECT_NEAR(At(x[0], y[0]), 184.52525, 1e-9);
    auto dem = Open(path);
    dem->SetOutputVerticalDatum(DatumEllipsoid);
    EXPECT_EQ(dem->GetOutputVerticalDatum(), DatumEllipsoid);
    double h[2];
    dem->GetHeights(2, x, y, h);
    // Within the single precision of the posts (about 3e-5 m here) and 1 mm.
    EXPECT_NEAR(h[0], 227.038653, 1e-3);
    EXPECT_NEAR(h[1], 330.774884, 1e-3);
    dem->SetOutputVerticalDatum(DatumMSL);
    dem->GetHeights(2, x, y, h);
    EXPECT_NEAR(h[0], 184.52525, 1e-4);

    // The other way, from a DEM of ellipsoidal heights.
    const std::string ell = dir.File("ell.tif");
    testsupport::WriteDem(ell, kGrid, "EPSG:32632", [](int, int) { return 200.0f; });
    auto fromEllipsoid = Open(ell, 10, false, DatumEllipsoid);
    fromEllipsoid->SetOutputVerticalDatum(DatumMSL);
    ASSERT_TRUE(fromEllipsoid->GetHeight(x[0], y[0], h[0]));
    EXPECT_NEAR(h[0], 157.486597, 1e-3);

    // A geographic DEM with a two-dimensional CRS, its MSL heights on EGM96.
    const std::string geographic = dir.File("geo.tif");
    testsupport::WriteDem(geographic, Grid{9.0, 45.6, 0.01, 40, 40}, "EPSG:4326",
                          [](int, int) { return 120.0f; });
    auto geo = Open(geographic);
    geo->SetOutputVerticalDatum(DatumEllipsoid);
    ASSERT_TRUE(geo->GetHeight(9.19, 45.46, h[0]));
    EXPECT_NEAR(h[0], 162.519972, 1e-3);
}

TEST(ConstantDem, ConstantInItsDatumFollowingTheGeoidInTheOther) {
    const ICRS crs("EPSG:32632");
    const GeocodingInfo grid = GeocodingInfo::NorthUp(514000, 5035000, 0.5, 0.5);
    // 4000 x 3000 pixels of 0.5 m: posts every 64 m.
    std::unique_ptr<IRasterDEM> dem(
        DEMFactory::CreateConstantDEMDownsampled(&crs, &grid, 4000, 3000, 120.0f, DatumMSL, 128));
    double minX, minY, maxX, maxY;
    dem->GetExtent(minX, minY, maxX, maxY);
    EXPECT_DOUBLE_EQ(minX, 514000);
    EXPECT_DOUBLE_EQ(maxX, 516000);
    EXPECT_DOUBLE_EQ(minY, 5033500);
    EXPECT_DOUBLE_EQ(maxY, 5035000);
    double h = NAN;
    for (double x : {514000.0, 515000.0, 516000.0}) {
        ASSERT_TRUE(dem->GetHeight(x, 5033500, h));
        EXPECT_EQ(h, 120.0);
    }
    EXPECT_FALSE(dem->GetHeight(513999, 5034000, h));
    EXPECT_FALSE(dem->GetHeight(515000, 5035000.5, h));

    dem->SetOutputVerticalDatum(DatumEllipsoid);
    // A post (1000 pixels = 500 m from the corner is not one; 1024 pixels = 512 m is).
    ASSERT_TRUE(dem->GetHeight(514512, 5034488, h));
    double reference[3] = {514512, 5034488, 120};
    CoordinateTransformation(ICRS("EPSG:32632+5773"), ICRS("EPSG:4979"))
        .Transform(1, &reference[0], &reference[1], &reference[2]);
    EXPECT_NEAR(h, reference[2], 1e-4);
    // Between posts, within 1 mm of PROJ's answer (162.513403, see above).
    ASSERT_TRUE(dem->GetHeight(515000, 5034000, h));
    EXPECT_NEAR(h, 162.513403, 1e-3);
    // The range follows the converted posts (cells of 16 posts: the geoid over a kilometre).
    double low = NAN, high = NAN;
    ASSERT_TRUE(dem->GetHeightRange(514900, 5033900, 515100, 5034100, low, high));
    EXPECT_TRUE(low <= h && h <= high && high - low < 0.5) << low << " " << high;
}

TEST(DemErrors, EachNamesWhatIsWrong) {
    testsupport::TempDir dir;
    const std::string text = testsupport::WriteFile(dir.File("dem.tif"), "not a raster");
    const std::string bare = dir.File("bare.tif");
    testsupport::WriteDem(bare, kGrid, "", Post, {}, false, 0, false);
    const std::string good = dir.File("good.tif");
    testsupport::WriteDem(good, kGrid, "", Post);
    const std::string placed = dir.File("placed.tif");
    testsupport::WriteDem(placed, kGrid, kCrs, Post);
    const ICRS local("LOCAL_CS[\"site grid\",UNIT[\"metre\",1]]");
    const std::string empty = dir.File("empty");
    std::filesystem::create_directory(empty);
    const ICRS crs("EPSG:32632");
    const GeocodingInfo grid;

    const struct {
        std::function<void()> call;
        std::string words;
    } cases[] = {
        {[&] { Open(text); }, text},
        {[&] { Open(bare); }, "has no georeferencing"},
        {[&] { Open(empty); }, "holds no raster"},
        {[&] { Open(good, 0); }, "at least 1 megabyte; 0"},
        {[&] { DEMFactory::CreateFileRasterDEM(good, 2, 0, 1, NAN, DatumMSL, false, 1); },
         "has no band 2"},
        {[&] { DEMFactory::CreateFileRasterDEM(good, 1, 0, 0, NAN, DatumMSL, false, 1); },
         "scale 0"},
        {[&] { Open(good, 1, false, static_cast<DatumType>(7)); }, "vertical datum 7"},
        {[&] { Open(good)->SetOutputVerticalDatum(DatumEllipsoid); }, "has no coordinate system"},
        {[&] { Open(good)->SetOutputVerticalDatum(DatumMathModel); }, "math model"},
        {[&] { Open(placed)->SetInputCRS(&local); }, "No transformation from \"site grid\""},
        {[&] {
             const double x = NAN, y = 0;
             double h;
             Open(good)->GetHeights(1, &x, &y, &h);
         },
         "not finite: point 0 is (nan, 0)"},
        {[&] { DEMFactory::CreateConstantDEMDownsampled(&crs, &grid, 0, 5, 1, DatumMSL, 128); },
         "0 x 5"},
        {[&] { DEMFactory::CreateConstantDEMDownsampled(&crs, nullptr, 5, 5, 1, DatumMSL, 128); },
         "geocoding"},
        {[&] { DEMFactory::CreateConstantDEMDownsampled(&crs, &grid, 5, 5, 1, DatumMSL, 0.5f); },
         "at least 1 pixel; 0.5"},
        {[&] { DEMFactory::CreateTileRasterDEM(good); }, "is not a tile index"},
        {[&] { GetScale("YARD"); }, "\"YARD\""},
    };
    for (const auto& c : cases) {
        const std::string message = testsupport::ThrownMessage(c.call, c.words);
        EXPECT_TRUE(testsupport::Contains(message, c.words)) << message;
    }
}

TEST_F(Dem, MissingGeoidGridIsRefusedAndNamed) {
    // PROJ would fall back to a no-op "ballpark" conversion without the grid.
    const std::string data = dir.File("proj");
    std::filesystem::create_directory(data);
    const CPLStringList previous(OSRGetPROJSearchPaths());
    for (int i = 0; i < previous.size(); ++i) {
        const std::string db = std::string(previous[i]) + "/proj.db";
        if (std::filesystem::exists(db)) {
            std::filesystem::copy_file(db, data + "/proj.db");
            break;
        }
    }
    const char* const only[] = {data.c_str(), nullptr};
    auto dem = Open(path);
    std::string message = "(no exception)";
    // On a thread of its own: PROJ remembers on each thread that it did not find the grid.
    std::thread([&] {
        OSRSetPROJSearchPaths(only);
        try {
            dem->SetOutputVerticalDatum(DatumEllipsoid);
        } catch (const kestrel::DataException& e) {
            message = e.what();
        }
        OSRSetPROJSearchPaths(previous.List());
    }).join();
    EXPECT_NE(message.find("egm96_15"), std::string::npos) << message;
    EXPECT_EQ(dem->GetOutputVerticalDatum(), DatumMSL);
    dem->SetOutputVerticalDatum(DatumEllipsoid);
}
