// TIN readers: a TIN made of a DEM's posts (as 3-D points or as triangles, in GeoPackage and
// Shapefile) gives the DEM's heights at the posts and planes between them; files without a
// surface give null, and a named layer that holds something else an error; units of the CRS,
// outliers and slivers.
#include <kestrel/tin.h>

#include "../platform/src/tin/tinreader.h"
#include "demdata.h"
#include "support.h"

#include <cmath>
#include <memory>

#include <ogrsf_frmts.h>

using namespace kestrel::ogc::cs;
using namespace kestrel::tin;
using testsupport::Grid;

namespace {

const Grid kGrid{514000, 5035000, 10, 12, 9};

float Post(int i, int j) {
    return static_cast<float>(100 + 3 * i + 0.5 * j * j);
}

// A vector file with one layer of the given geometries, written with OGR.
void WriteLayer(const std::string& path, const char* driverName, OGRwkbGeometryType type,
                const std::vector<std::unique_ptr<OGRGeometry>>& geometries,
                const char* crs = "EPSG:32632") {
    GDALAllRegister();
    GDALDriver* driver = GetGDALDriverManager()->GetDriverByName(driverName);
    GDALDatasetUniquePtr ds(driver->Create(path.c_str(), 0, 0, 0, GDT_Unknown, nullptr));
    OGRSpatialReference srs;
    srs.SetFromUserInput(crs);
    OGRLayer* layer = ds->CreateLayer("surface", &srs, type, nullptr);
    for (const auto& g : geometries) {
        OGRFeature feature(layer->GetLayerDefn());
        feature.SetGeometry(g.get());
        if (layer->CreateFeature(&feature) != OGRERR_NONE)
            throw std::runtime_error("cannot write " + path);
    }
}

std::vector<std::unique_ptr<OGRGeometry>> Posts() {
    std::vector<std::unique_ptr<OGRGeometry>> points;
    for (int j = 0; j < kGrid.height; ++j)
        for (int i = 0; i < kGrid.width; ++i)
            points.push_back(std::make_unique<OGRPoint>(kGrid.X(i), kGrid.Y(j), Post(i, j)));
    return points;
}

std::unique_ptr<OGRGeometry> TrianglePolygon(const std::array<OGRPoint, 3>& corners) {
    OGRLinearRing ring;
    for (const auto& p : corners)
        ring.addPoint(&p);
    ring.closeRings();
    auto polygon = std::make_unique<OGRPolygon>();
    polygon->addRing(&ring);
    return polygon;
}

// Two triangles a cell of posts.
std::vector<std::unique_ptr<OGRGeometry>> Triangles() {
    std::vector<std::unique_ptr<OGRGeometry>> triangles;
    const auto corner = [](int i, int j) { return OGRPoint(kGrid.X(i), kGrid.Y(j), Post(i, j)); };
    for (int j = 0; j + 1 < kGrid.height; ++j) {
        for (int i = 0; i + 1 < kGrid.width; ++i) {
            for (const auto& c :
                 {std::array<OGRPoint, 3>{corner(i, j), corner(i + 1, j), corner(i, j + 1)},
                  std::array<OGRPoint, 3>{corner(i + 1, j), corner(i + 1, j + 1),
                                          corner(i, j + 1)}})
                triangles.push_back(TrianglePolygon(c));
        }
    }
    return triangles;
}

std::unique_ptr<TinReader> Open(const std::string& path, int layer = 0,
                                DatumType datum = DatumMSL) {
    return std::unique_ptr<TinReader>(
        TinReaderFactory::CreateTinReader(path.c_str(), layer, 0.0, 1.0, datum));
}

}  // namespace

TEST(Tin, MadeOfPostsGivesThePostsHeights) {
    testsupport::TempDir dir;
    WriteLayer(dir.File("points.gpkg"), "GPKG", wkbPoint25D, Posts());
    WriteLayer(dir.File("triangles.gpkg"), "GPKG", wkbPolygon25D, Triangles());
    WriteLayer(dir.File("triangles.shp"), "ESRI Shapefile", wkbPolygon25D, Triangles());
    for (const char* name : {"points.gpkg", "triangles.gpkg", "triangles.shp"}) {
        SCOPED_TRACE(name);
        auto tin = Open(dir.File(name));
        ASSERT_TRUE(tin);
        EXPECT_EQ(tin->GetTriangleCount(), 2u * 11 * 8);
        EXPECT_TRUE(tin->GetCRS()->IsSame(ICRS("EPSG:32632")));
        double minX, minY, maxX, maxY;
        tin->GetExtent(minX, minY, maxX, maxY);
        EXPECT_EQ(minX, kGrid.X(0));
        EXPECT_EQ(maxY, kGrid.Y(0));
        std::vector<double> x, y, h;
        for (int j = 0; j < kGrid.height; ++j)
            for (int i = 0; i < kGrid.width; ++i)
                x.push_back(kGrid.X(i)), y.push_back(kGrid.Y(j));
        h.resize(x.size());
        tin->GetHeights(x.size(), x.data(), y.data(), h.data());
        for (std::size_t k = 0; k < x.size(); ++k)
            ASSERT_NEAR(h[k],
                        Post(static_cast<int>(k % kGrid.width), static_cast<int>(k / kGrid.width)),
                        1e-9)
                << k;
        // Heights vary linearly along a row of posts (3 m a post); none outside.
        double mid = NAN;
        ASSERT_TRUE(tin->GetHeight(kGrid.X(2.5), kGrid.Y(4), mid));
        EXPECT_NEAR(mid, Post(2, 4) + 1.5, 1e-9);
        EXPECT_FALSE(tin->GetHeight(kGrid.X(-0.1), kGrid.Y(4), mid));
    }
}

TEST(Tin, OffsetScaleAndOutputDatum) {
    testsupport::TempDir dir;
    std::vector<std::unique_ptr<OGRGeometry>> points;
    for (double dx : {-500.0, 500.0})
        for (double dy : {-500.0, 500.0})
            points.push_back(std::make_unique<OGRPoint>(515000 + dx, 5034000 + dy, 60.0));
    WriteLayer(dir.File("flat.gpkg"), "GPKG", wkbPoint25D, points);
    std::unique_ptr<TinReader> tin(
        TinReaderFactory::CreateTinReader(dir.File("flat.gpkg").c_str(), 1, 0.0, 2.0, DatumMSL));
    ASSERT_TRUE(tin);
    double h = NAN;
    ASSERT_TRUE(tin->GetHeight(515000, 5034000, h));
    EXPECT_EQ(h, 120.0);
    // printf "515000 5034000 120\n" | cs2cs -d 6 EPSG:32632+5773 EPSG:4979 -> 162.513403
    tin->SetOutputVerticalDatum(DatumEllipsoid);
    ASSERT_TRUE(tin->GetHeight(515000, 5034000, h));
    EXPECT_NEAR(h, 162.513403, 1e-3);

    // Heights in US survey feet (NAVD88): in metres, the unit applied before the scale.
    WriteLayer(dir.File("feet.gpkg"), "GPKG", wkbPoint25D, points, "EPSG:32618+6360");
    tin.reset(
        TinReaderFactory::CreateTinReader(dir.File("feet.gpkg").c_str(), 1, 1.0, 2.0, DatumMSL));
    ASSERT_TRUE(tin);
    ASSERT_TRUE(tin->GetHeight(515000, 5034000, h));
    EXPECT_NEAR(h, 1.0 + 2.0 * 60.0 * 1200.0 / 3937.0, 1e-9);
}

// One far outlier point, a point with an infinite height, or long sliver triangles leave the
// index small (a lookup tests few triangles) and the heights and height ranges right.
TEST(Tin, IndexStaysSmallWithOutliersAndSlivers) {
    testsupport::TempDir dir;
    const auto plane = [](double x, double y) { return 0.5 * (x - 514000) + 2.0 * (y - 5034000); };
    std::vector<std::unique_ptr<OGRGeometry>> outlier;
    for (int j = 0; j < 40; ++j)
        for (int i = 0; i < 40; ++i)
            outlier.push_back(
                std::make_unique<OGRPoint>(514000 + 10.0 * i, 5034000 + 10.0 * j,
                                           plane(514000 + 10.0 * i, 5034000 + 10.0 * j)));
    outlier.push_back(std::make_unique<OGRPoint>(514000 + 1e7, 5034200, 5000.0));
    outlier.push_back(std::make_unique<OGRPoint>(514005, 5034005, INFINITY));
    WriteLayer(dir.File("outlier.gpkg"), "GPKG", wkbPoint25D, outlier);

    // Slivers: a long sheared strip cut into triangles one metre wide.
    std::vector<std::unique_ptr<OGRGeometry>> slivers;
    const auto corner = [&](double x, double y) { return OGRPoint(x, y, plane(x, y)); };
    for (int i = 0; i < 600; ++i) {
        const double b = 514000 + i, s = 600;
        for (const auto& c :
             {std::array<OGRPoint, 3>{corner(b, 5034000), corner(b + 1, 5034000),
                                      corner(b + s, 5034000 + s)},
              std::array<OGRPoint, 3>{corner(b + 1, 5034000), corner(b + 1 + s, 5034000 + s),
                                      corner(b + s, 5034000 + s)}})
            slivers.push_back(TrianglePolygon(c));
    }
    WriteLayer(dir.File("slivers.gpkg"), "GPKG", wkbPolygon25D, slivers);

    const struct {
        const char* file;
        std::size_t largestCell;  // a bounding-box grid lists 500 to 3000; the fan of triangles
                                  // to the outlier (39) meets one border cell
        double x0, y0, x1, y1;    // a window, well inside
        double ceiling;           // the range is of whole triangles: long ones reach high
    } cases[] = {
        {"outlier.gpkg", 48, 514100, 5034100, 514150, 5034130, 1000},
        {"slivers.gpkg", 160, 514500, 5034200, 514530, 5034220, 2000},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.file);
        auto tin = Open(dir.File(c.file));
        ASSERT_TRUE(tin);
        EXPECT_LE(LargestIndexCell(*tin), c.largestCell);
        // The plane at random points of the window, and a range that holds them but not the
        // outlier.
        std::vector<double> x, y, h;
        for (int k = 0; k < 200; ++k) {
            x.push_back(c.x0 + (c.x1 - c.x0) * ((k * 37) % 101) / 100.0);
            y.push_back(c.y0 + (c.y1 - c.y0) * ((k * 59) % 103) / 102.0);
        }
        h.resize(x.size());
        tin->GetHeights(x.size(), x.data(), y.data(), h.data());
        double low = NAN, high = NAN;
        ASSERT_TRUE(tin->GetHeightRange(c.x0, c.y0, c.x1, c.y1, low, high));
        EXPECT_LT(high, c.ceiling);
        for (std::size_t k = 0; k < x.size(); ++k) {
            ASSERT_NEAR(h[k], plane(x[k], y[k]), 1e-6) << x[k] << " " << y[k];
            EXPECT_LE(low, h[k]);
            EXPECT_GE(high, h[k]);
        }
    }
}

TEST(Tin, NoSurfaceGivesNullOrNamesTheFeature) {
    testsupport::TempDir dir;
    std::vector<std::unique_ptr<OGRGeometry>> squares, flat;
    auto square = std::make_unique<OGRPolygon>();
    OGRLinearRing ring;
    for (auto [x, y] : {std::pair{0, 0}, {0, 1}, {1, 1}, {1, 0}, {0, 0}})
        ring.addPoint(x, y, 1.0);
    square->addRing(&ring);
    squares.push_back(std::move(square));
    WriteLayer(dir.File("squares.gpkg"), "GPKG", wkbPolygon25D, squares);
    for (int i = 0; i < 3; ++i)
        flat.push_back(std::make_unique<OGRPoint>(i, i * i));
    WriteLayer(dir.File("flat.gpkg"), "GPKG", wkbPoint, flat);
    testsupport::WriteFile(dir.File("text.gpkg"), "not a vector file");

    EXPECT_FALSE(Open(dir.File("missing.gpkg")));
    EXPECT_FALSE(Open(dir.File("text.gpkg")));
    EXPECT_FALSE(Open(dir.File("squares.gpkg")));
    EXPECT_FALSE(Open(dir.File("flat.gpkg")));
    EXPECT_FALSE(Open(dir.File("flat.gpkg"), 2));  // no second layer
    const std::string message = testsupport::ThrownMessage<kestrel::DataException>(
        [&] { Open(dir.File("squares.gpkg"), 1); });
    EXPECT_TRUE(testsupport::Contains(message, "feature 1: a polygon that is not a triangle"))
        << message;
    EXPECT_THROW(Open(dir.File("flat.gpkg"), -1), kestrel::DataException);
}
