// The true-ortho generator on synthetic scenes: the sample builder's RPC fit, hidden strips,
// roof positions, agreement with gdalwarp on visible ground, cancellation and bad input.
#include <kestrel/resampler.h>
#include <kestrel/trueortho.h>
#include <samplecity.h>

#include "rasterread.h"
#include "program.h"
#include "surface.h"

#include <gdal_priv.h>

#include <cmath>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <limits>
#include <memory>
#include <sstream>


namespace {

using kestrel::DataException;
using kestrel::processes::TorthoGenerator;
using kestrel::processes::TorthoJob;
using kestrel::processes::TorthoResult;
using testsupport::RunCommand;
using testsupport::TempDir;


TEST(SampleCity, RpcsAgreeWithTheCameraThroughGdalsTransformer) {
    TempDir dir;
    samplecity::CityOptions options = samplecity::SmallCity();
    options.cameras.resize(2);
    for (auto& c : options.cameras)
        c.width = c.height = 128, c.groundSampleDistance = 2.0;
    const samplecity::Sample sample = samplecity::MakeSample(dir.Path().string(), options, 1);
    ASSERT_EQ(sample.images.size(), 2u);
    const kestrel::ogc::cs::ICRS utm(options.crs), wgs84("EPSG:4326");
    const kestrel::ogc::cs::CoordinateTransformation toGeographic(utm, wgs84);
    for (const auto& image : sample.images) {
        EXPECT_LT(image.rpcMaxResidual, 0.01);
        // Ground points spread over the scene and its height range.
        std::ostringstream input;
        std::vector<std::pair<double, double>> expected;
        for (double x : {514850.0, 514900.0, 514950.0, 515000.0})
            for (double h : {250.0, 262.0, 280.0}) {
                double lon = x, lat = 5033900.0 + (x - 514800) / 2, col, row;
                image.camera->Project(lon, lat, h, col, row);
                toGeographic.Transform(1, &lon, &lat);
                input.precision(12);
                input << lon << ' ' << lat << ' ' << h << '\n';
                expected.emplace_back(col, row);
            }
        testsupport::WriteFile(dir.File("ground.txt"), input.str());
        std::istringstream out(
            RunCommand("gdaltransform -i -rpc " + image.path + " < " + dir.File("ground.txt")));
        for (const auto& e : expected) {
            double col = 0, row = 0, z = 0;
            ASSERT_TRUE(out >> col >> row >> z);
            EXPECT_NEAR(col, e.first, 0.01);
            EXPECT_NEAR(row, e.second, 0.01);
        }
    }
}

// The grid-to-image projection interpolated on its lattice stays within its bound of the exact
// one, on an oblique RPC image from 400 m (strong perspective) over buildings, at the surface's
// heights and at heights spread over its whole range in every pixel.
TEST(GridProjection, InterpolationStaysWithinItsBoundOfTheExactProjection) {
    TempDir dir;
    samplecity::CityOptions options = samplecity::SmallCity();
    options.cameras = {{"oblique", 20.0, 30.0, 400.0, 512, 512, 0.5}};
    const samplecity::Sample sample = samplecity::MakeSample(dir.Path().string(), options, 2);
    const samplecity::RpcModel model(sample.images[0].path);
    samplecity::GridSurface surface(sample.dsmPath);
    const kestrel::ogc::cs::ICRS utm(options.crs);
    const kestrel::ogc::cs::CoordinateTransformation toModel(utm, *model.GetCRS());
    const auto grid = kestrel::ogc::cs::GeocodingInfo::NorthUp(
        options.west, options.south + options.sizeY, 0.5, 0.5);
    const int x0 = 40, y0 = 60, width = 300, height = 280;
    const size_t n = static_cast<size_t>(width) * height;
    std::vector<double> x(n), y(n), onSurface(n), spread(n);
    for (int j = 0; j < height; ++j)
        for (int i = 0; i < width; ++i)
            grid.PixelToGround(x0 + i + 0.5, y0 + j + 0.5, x[j * width + i], y[j * width + i]);
    surface.GetHeights(n, x.data(), y.data(), onSurface.data());
    for (size_t k = 0; k < n; ++k)
        spread[k] = 250.0 + 35.0 * ((k * 7919) % 1000) / 999.0;
    for (const std::vector<double>* heights : {&onSurface, &spread}) {
        std::vector<double> col(n), row(n), exactCol(n), exactRow(n);
        std::unique_ptr<bool[]> ok(new bool[n]), exactOk(new bool[n]);
        kestrel::processes::GridProjection exact(grid, model, &toModel, 0.0);
        exact.Project(x0, y0, width, height, heights->data(), exactCol.data(), exactRow.data(),
                      exactOk.get());
        EXPECT_EQ(exact.LastStep(), 0);
        for (const double bound : {0.05, 0.01}) {
            SCOPED_TRACE(bound);
            kestrel::processes::GridProjection fast(grid, model, &toModel, bound);
            fast.Project(x0, y0, width, height, heights->data(), col.data(), row.data(),
                         ok.get());
            EXPECT_GE(fast.LastStep(), 4);  // interpolated, not exact in disguise
            double largest = 0;
            for (size_t k = 0; k < n; ++k) {
                ASSERT_EQ(ok[k], exactOk[k]) << k;
                if (ok[k])
                    largest = std::max(largest, std::hypot(col[k] - exactCol[k],
                                                           row[k] - exactRow[k]));
            }
            EXPECT_LE(largest, bound);
            EXPECT_GT(largest, 0.0);
        }
    }
}

using testsupport::ReadBand;

// A box building 20 m high on flat ground, seen from the north at 30 degrees off nadir, with its
// ortho grid at 0.5 m over the whole surface model.
struct BoxFixture : ::testing::Test {
    TempDir dir;
    samplecity::CityOptions options = samplecity::BoxScene(20.0, {0.0});
    samplecity::Sample sample;
    std::unique_ptr<samplecity::Dsm> dsm;
    std::unique_ptr<samplecity::GridSurface> surface;
    std::unique_ptr<samplecity::RpcModel> model;
    kestrel::ogc::cs::ICRS crs{"EPSG:32632"};
    // The ortho's pixel: the image's at the scene centre. gdalwarp widens its kernels where the
    // output is coarser than the image, so it is compared on a grid finer than the image.
    double pixel = 0.5;
    // Metres between the grid and the surface model's edges.
    double inset = 0.0;
    unsigned int size = 0;

    void SetUp() override {
        sample = samplecity::MakeSample(dir.Path().string(), options, 2);
        dsm = std::make_unique<samplecity::Dsm>(options);
        surface = std::make_unique<samplecity::GridSurface>(sample.dsmPath);
        model = std::make_unique<samplecity::RpcModel>(sample.images[0].path);
        UsePixel(0.5);
    }
    void UsePixel(double p, double i = 0.0) {
        pixel = p, inset = i;
        size = static_cast<unsigned int>(std::lround((options.sizeX - 2 * inset) / pixel));
    }
    TorthoJob Job() const {
        TorthoJob job;
        job.sourcePath = sample.images[0].path;
        job.model = model.get();
        job.surface = surface.get();
        job.crs = &crs;
        job.geocoding = kestrel::ogc::cs::GeocodingInfo::NorthUp(
            options.west + inset, options.south + options.sizeY - inset, pixel, pixel);
        job.pixels = job.lines = size;
        job.orthoPath = dir.File("ortho.tif");
        job.visibilityPath = dir.File("visibility.tif");
        job.tileSize = 64;  // several tiles, so that occluders lie in neighbouring tiles
        return job;
    }
    // gdalwarp's ortho of the same image on the same grid, without occlusion handling.
    std::string FormatCommand(const std::string& out, const std::string& method) const {
        std::ostringstream c;
        c.precision(12);
        c << "gdalwarp -q -overwrite -rpc -to RPC_DEM=" << sample.dsmPath
          << " -to RPC_DEMINTERPOLATION=bilinear -t_srs EPSG:32632 -tr " << pixel << ' ' << pixel
          << " -te " << options.west + inset << ' ' << options.south + inset << ' '
          << options.west + options.sizeX - inset << ' ' << options.south + options.sizeY - inset
          << " -r " << method << " -et 0 " << sample.images[0].path << ' ' << out;
        return c.str();
    }
    void Ground(unsigned int i, unsigned int j, double& x, double& y) const {
        x = options.west + inset + (i + 0.5) * pixel;
        y = options.south + options.sizeY - inset - (j + 0.5) * pixel;
    }
    // Whether the segment from a ground point to the camera passes through the box.
    bool GeometricallyHidden(double x, double y) const {
        const auto& b = options.buildings[0];
        const auto& c = sample.images[0].camera->Centre();
        const double z = dsm->HeightAt(x, y);
        if (z > options.groundHeight + 1)
            return false;  // on the roof
        double t0 = 0, t1 = 1;
        const double from[3] = {x, y, z}, to[3] = {c[0], c[1], c[2]};
        const double lo[3] = {options.west + b.x0, options.south + b.y0, -1e9};
        const double hi[3] = {options.west + b.x1, options.south + b.y1,
                              options.groundHeight + b.height};
        for (int a = 0; a < 3; ++a) {
            const double d = to[a] - from[a];
            if (std::fabs(d) < 1e-12) {
                if (from[a] < lo[a] || from[a] > hi[a])
                    return false;
                continue;
            }
            double ta = (lo[a] - from[a]) / d, tb = (hi[a] - from[a]) / d;
            if (ta > tb)
                std::swap(ta, tb);
            t0 = std::max(t0, ta), t1 = std::min(t1, tb);
        }
        return t0 < t1;
    }
};

TEST_F(BoxFixture, HiddenStripRoofAndGroundStandWhereGeometryPutsThem) {
    const TorthoResult result = TorthoGenerator().Generate(Job());
    ASSERT_TRUE(result.completed);
    const std::vector<double> visibility = ReadBand(dir.File("visibility.tif"));
    const std::vector<double> red = ReadBand(dir.File("ortho.tif"), 1);
    ASSERT_EQ(visibility.size(), static_cast<size_t>(size) * size);

    // The hidden strip: every pixel whose state differs from geometry has a neighbour within
    // one pixel whose state agrees.
    auto at = [&](int i, int j) { return static_cast<size_t>(j) * size + i; };
    std::vector<char> expected(visibility.size());
    size_t hiddenByGeometry = 0;
    for (unsigned int j = 0; j < size; ++j)
        for (unsigned int i = 0; i < size; ++i) {
            double x, y;
            Ground(i, j, x, y);
            expected[at(i, j)] = GeometricallyHidden(x, y);
            hiddenByGeometry += expected[at(i, j)];
        }
    EXPECT_GT(hiddenByGeometry, 1000u);
    size_t wrong = 0;
    for (int j = 1; j + 1 < static_cast<int>(size); ++j)
        for (int i = 1; i + 1 < static_cast<int>(size); ++i) {
            if (visibility[at(i, j)] == 0)
                continue;  // outside the image
            const bool hidden = visibility[at(i, j)] == 2;
            if (hidden == static_cast<bool>(expected[at(i, j)]))
                continue;
            bool nearby = false;
            for (int dj = -1; dj <= 1; ++dj)
                for (int di = -1; di <= 1; ++di)
                    nearby |= static_cast<bool>(expected[at(i + di, j + dj)]) == hidden;
            wrong += !nearby;
        }
    EXPECT_EQ(wrong, 0u);
    EXPECT_NEAR(static_cast<double>(result.hidden), static_cast<double>(hiddenByGeometry),
                0.1 * hiddenByGeometry);

    // The roof at its true ground position, seen, in its own colour.
    const auto& b = options.buildings[0];
    size_t roofPixels = 0;
    for (unsigned int j = 0; j < size; ++j)
        for (unsigned int i = 0; i < size; ++i) {
            double x, y;
            Ground(i, j, x, y);
            const double lx = x - options.west, ly = y - options.south;
            if (lx < b.x0 + 1 || lx > b.x1 - 1 || ly < b.y0 + 1 || ly > b.y1 - 1)
                continue;
            ++roofPixels;
            ASSERT_EQ(visibility[at(i, j)], 1) << "roof pixel " << i << ", " << j;
            const auto rgb = samplecity::Texture(*dsm, x, y, dsm->HeightAt(x, y), options.seed);
            EXPECT_NEAR(red[at(i, j)], rgb[0], 12) << "roof pixel " << i << ", " << j;
        }
    EXPECT_GT(roofPixels, 3000u);
}

TEST_F(BoxFixture, VisibleGroundMatchesGdalwarpWithin1) {
    // Away from the surface model's edges, where gdalwarp's source windows miss parts of the
    // image (its RPC inversion fails off the DEM).
    UsePixel(0.4, 10.0);
    const std::string reference = dir.File("gdalwarp.tif");
    for (const std::string method : {"bilinear", "cubic", "cubicspline", "lanczos"}) {
        const std::string command = FormatCommand(reference, method);
        ASSERT_EQ(std::system(command.c_str()), 0) << command;
        // The generator's own kernel where it has one, and the platform's resampler given in
        // the job.
        const std::unique_ptr<kestrel::utils::IRasterResampler> resampler(
            kestrel::utils::ResamplerFactory().GetResampler(method));
        const bool own = method == "bilinear" || method == "cubic";
        for (const bool given : {false, true}) {
            if (!given && !own)
                continue;
            TorthoJob job = Job();
            job.resampling = method;
            job.resampler = given ? resampler.get() : nullptr;
            ASSERT_TRUE(TorthoGenerator().Generate(job).completed);
            const std::vector<double> visibility = ReadBand(dir.File("visibility.tif"));
            for (int band = 1; band <= 3; ++band) {
                const std::vector<double> ours = ReadBand(dir.File("ortho.tif"), band);
                const std::vector<double> theirs = ReadBand(reference, band);
                ASSERT_EQ(ours.size(), theirs.size());
                size_t compared = 0, differing = 0;
                for (unsigned int j = 3; j + 3 < size; ++j)
                    for (unsigned int i = 3; i + 3 < size; ++i) {
                        // Seen ground, away from the building and the hidden strip.
                        bool clear = true;
                        for (int dj = -3; dj <= 3 && clear; ++dj)
                            for (int di = -3; di <= 3 && clear; ++di) {
                                const size_t k = static_cast<size_t>(j + dj) * size + (i + di);
                                double x, y;
                                Ground(i + di, j + dj, x, y);
                                clear = visibility[k] == 1 &&
                                        dsm->HeightAt(x, y) < options.groundHeight + 0.01;
                            }
                        if (!clear)
                            continue;
                        const size_t k = static_cast<size_t>(j) * size + i;
                        ++compared;
                        differing += std::fabs(ours[k] - theirs[k]) > 1;
                    }
                EXPECT_GT(compared, 60000u);
                EXPECT_EQ(differing, 0u)
                    << method << ", band " << band << (given ? ", resampler given" : "");
            }
        }
    }
}

// A surface with one spot (half a metre around a ground point) whose heights are replaced.
class SpikedSurface : public samplecity::GridSurface {
  public:
    SpikedSurface(const std::string& path, double x, double y, double value)
        : GridSurface(path), x_(x), y_(y), value_(value) {}
    void GetHeights(std::size_t n, const double* x, const double* y,
                    double* heights) const override {
        GridSurface::GetHeights(n, x, y, heights);
        for (std::size_t k = 0; k < n; ++k)
            if (std::fabs(x[k] - x_) < 0.5 && std::fabs(y[k] - y_) < 0.5)
                heights[k] = value_;
    }

  private:
    double x_, y_, value_;
};

// Two threads, more threads than tiles (capped before anything is made for them) and an
// infinite post (no height there, and no tile widened by it) write what one thread writes on
// clean data, but for the spot without height.
TEST_F(BoxFixture, ThreadCountsAndAnInfinitePostChangeNothingElse) {
    auto run = [&](unsigned int threads, const kestrel::dem::IElevationSource* spiked) {
        kestrel::processes::GeneratorSettings settings;
        settings.threadCount = threads;
        TorthoJob job = Job();
        if (spiked != nullptr)
            job.surface = const_cast<kestrel::dem::IElevationSource*>(spiked);
        EXPECT_TRUE(TorthoGenerator(settings).Generate(job).completed);
        std::vector<std::vector<double>> out;
        for (int band = 1; band <= 3; ++band)
            out.push_back(ReadBand(dir.File("ortho.tif"), band));
        out.push_back(ReadBand(dir.File("visibility.tif")));
        return out;
    };
    const std::vector<std::vector<double>> clean = run(1, nullptr);
    const SpikedSurface infinite(sample.dsmPath, options.west + 30.3, options.south + 30.3,
                                 std::numeric_limits<double>::infinity());
    const struct {
        const char* name;
        unsigned int threads;
        const SpikedSurface* surface;
    } cases[] = {{"two threads", 2, nullptr},
                 {"more threads than tiles", std::numeric_limits<unsigned int>::max(), nullptr},
                 {"an infinite post", 1, &infinite}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        const std::vector<std::vector<double>> out = run(c.threads, c.surface);
        ASSERT_EQ(out.size(), clean.size());
        size_t noHeight = 0, differing = 0;
        for (size_t k = 0; k < out[3].size(); ++k) {
            if (out[3][k] == kestrel::processes::VISIBILITY_NODATA) {
                ++noHeight;
                continue;
            }
            for (const size_t b : {0, 1, 2, 3})
                differing += out[b][k] != clean[b][k];
        }
        EXPECT_EQ(differing, 0u);
        EXPECT_EQ(noHeight, c.surface != nullptr ? 4u : 0u);
    }
}

// No output, final or partial, is left in the directory.
void ExpectNoOutputs(const TempDir& dir) {
    for (const auto& entry : std::filesystem::directory_iterator(dir.Path())) {
        const std::string name = entry.path().filename().string();
        EXPECT_EQ(name.find("ortho"), std::string::npos) << name;
        EXPECT_EQ(name.find("visibility"), std::string::npos) << name;
    }
}

struct Cancelling {
    bool* flag;
    bool answer;  // what the callback returns
    int calls = 0;
    static bool Progress(double fraction, const char*, void* data) {
        auto* self = static_cast<Cancelling*>(data);
        ++self->calls;
        if (fraction > 0)
            testsupport::RaiseCancelFlag(self->flag);
        return fraction == 0 || self->answer;
    }
};

TEST_F(BoxFixture, CancelledRunStopsAfterTheTileAtHandAndLeavesNoOutput) {
    for (const bool byCallback : {false, true}) {
        bool cancel = false;
        kestrel::processes::GeneratorSettings settings;
        settings.threadCount = 1;
        TorthoGenerator generator(settings);
        Cancelling progress{&cancel, !byCallback};
        generator.SetCancelFlag(&cancel);
        generator.SetProgress(&Cancelling::Progress, &progress);
        const TorthoResult result = generator.Generate(Job());
        EXPECT_FALSE(result.completed);
        EXPECT_EQ(progress.calls, 2);  // the start and the first of 25 tiles
        ExpectNoOutputs(dir);
    }
    // A flag set before the run: nothing is written at all.
    bool cancel = true;
    TorthoGenerator generator;
    generator.SetCancelFlag(&cancel);
    EXPECT_FALSE(generator.Generate(Job()).completed);
    ExpectNoOutputs(dir);
}

TEST_F(BoxFixture, ReaderAndWritersGiveWhatPathsGive) {
    using kestrel::datasources::BasicReader;
    using kestrel::datasources::BasicWriter;
    auto writersJob = [&](BasicReader& reader, std::unique_ptr<BasicWriter>& ortho,
                          std::unique_ptr<BasicWriter>& visibility) {
        ortho = std::make_unique<BasicWriter>(dir.File("w-ortho.tif"),
                                              std::vector<unsigned int>{1, 2, 3}, "GTiff", "");
        visibility = std::make_unique<BasicWriter>(dir.File("w-visibility.tif"),
                                                   std::vector<unsigned int>{1}, "GTiff", "");
        TorthoJob job = Job();
        job.sourcePath.clear(), job.orthoPath.clear(), job.visibilityPath.clear();
        job.source = &reader, job.orthoWriter = ortho.get(),
        job.visibilityWriter = visibility.get();
        return job;
    };
    kestrel::processes::GeneratorSettings settings;
    settings.threadCount = 2;
    BasicReader reader(sample.images[0].path);
    {
        // Cancelled after the first tile: the writers are left unclosed and leave nothing.
        bool cancel = false;
        Cancelling progress{&cancel, true};
        TorthoGenerator generator(settings);
        generator.SetCancelFlag(&cancel);
        generator.SetProgress(&Cancelling::Progress, &progress);
        std::unique_ptr<BasicWriter> ortho, visibility;
        EXPECT_FALSE(generator.Generate(writersJob(reader, ortho, visibility)).completed);
        EXPECT_FALSE(ortho->IsClosed());
        ortho.reset(), visibility.reset();
        ExpectNoOutputs(dir);
    }
    std::unique_ptr<BasicWriter> ortho, visibility;
    ASSERT_TRUE(
        TorthoGenerator(settings).Generate(writersJob(reader, ortho, visibility)).completed);
    EXPECT_TRUE(ortho->IsClosed() && visibility->IsClosed());
    ASSERT_TRUE(TorthoGenerator(settings).Generate(Job()).completed);
    for (int band = 1; band <= 3; ++band) {
        const std::vector<double> expected = ReadBand(dir.File("ortho.tif"), band);
        ASSERT_FALSE(expected.empty());
        EXPECT_TRUE(ReadBand(dir.File("w-ortho.tif"), band) == expected) << band;
    }
    EXPECT_TRUE(ReadBand(dir.File("w-visibility.tif")) == ReadBand(dir.File("visibility.tif")));

    // Paths in a format written by copy: the same values, the visibility index one Byte band.
    for (const auto& [format, ext] : {std::pair<const char*, const char*>{"COG", ".tif"},
                                      std::pair<const char*, const char*>{"PNG", ".png"}}) {
        TorthoJob job = Job();
        job.format = format;
        job.orthoPath = dir.File(std::string("f-ortho") + ext);
        job.visibilityPath = dir.File(std::string("f-visibility") + ext);
        ASSERT_TRUE(TorthoGenerator(settings).Generate(job).completed) << format;
        for (int band = 1; band <= 3; ++band)
            EXPECT_TRUE(ReadBand(job.orthoPath, band) == ReadBand(dir.File("ortho.tif"), band))
                << format << ", band " << band;
        EXPECT_TRUE(ReadBand(job.visibilityPath) == ReadBand(dir.File("visibility.tif")))
            << format;
        std::unique_ptr<GDALDataset> vis(
            GDALDataset::Open(job.visibilityPath.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
        ASSERT_TRUE(vis) << format;
        EXPECT_EQ(vis->GetRasterCount(), 1) << format;
        EXPECT_EQ(vis->GetRasterBand(1)->GetRasterDataType(), GDT_Byte) << format;
        const char* layout = vis->GetMetadataItem("LAYOUT", "IMAGE_STRUCTURE");
        EXPECT_EQ(std::string(format) == "COG", layout != nullptr && std::string(layout) == "COG");
    }
}

// The same height everywhere, with no edge, in the grid's coordinates.
testsupport::FunctionSurface FlatEverywhere() {
    return {[](double, double) { return 250.0; }, -1e12, -1e12, 1e12, 1e12, ""};
}

// A grid that reaches the image by one corner pixel (a scene's window that an area of interest
// clips to a sliver), which a 17 x 17 lattice over it misses: made, not refused.
TEST_F(BoxFixture, GridThatReachesTheImageByOnePixelIsMade) {
    testsupport::FunctionSurface flat = FlatEverywhere();
    // Where the image lies on a coarse grid around it: its pixel nearest the grid's top left.
    const double step = 4.0, margin = 200.0;
    const unsigned int cells = static_cast<unsigned int>((options.sizeX + 2 * margin) / step);
    TorthoJob around = Job();
    around.surface = &flat;
    around.geocoding = kestrel::ogc::cs::GeocodingInfo::NorthUp(
        options.west - margin, options.south + options.sizeY + margin, step, step);
    around.pixels = around.lines = cells;
    ASSERT_TRUE(TorthoGenerator().Generate(around).completed);
    const std::vector<double> coarse = ReadBand(dir.File("visibility.tif"));
    unsigned int corner = cells * cells;
    for (unsigned int k = 0; k < coarse.size(); ++k) {
        if (coarse[k] != 0 && (corner == cells * cells ||
                               k % cells + k / cells < corner % cells + corner / cells))
            corner = k;
    }
    ASSERT_LT(corner, cells * cells);
    // A grid of 100 x 100 whose last pixel is that one: no other pixel of it is in the image.
    TorthoJob sliver = around;
    sliver.geocoding = kestrel::ogc::cs::GeocodingInfo::NorthUp(
        options.west - margin + (corner % cells - 99.0) * step,
        options.south + options.sizeY + margin - (corner / cells - 99.0) * step, step, step);
    sliver.pixels = sliver.lines = 100;
    ASSERT_TRUE(TorthoGenerator().Generate(sliver).completed);
    const std::vector<double> visibility = ReadBand(dir.File("visibility.tif"));
    EXPECT_NE(visibility.back(), 0.0);
    EXPECT_EQ(std::count(visibility.begin(), visibility.end(), 0.0), 100 * 100 - 1);
}

TEST_F(BoxFixture, BadInputIsRefusedWithWhatAndWhere) {
    testsupport::FunctionSurface flat = FlatEverywhere();
    const struct {
        const char* what;
        std::function<void(TorthoJob&)> spoil;
        const char* message;
    } cases[] = {
        {"no pixels", [](TorthoJob& j) { j.pixels = 0; }, "0 pixels"},
        {"surface elsewhere",
         [&](TorthoJob& j) {
             j.geocoding = kestrel::ogc::cs::GeocodingInfo::NorthUp(516000, 5034000, 0.5, 0.5);
         },
         "does not meet the output grid"},
        {"grid outside the image",
         [&](TorthoJob& j) {
             j.surface = &flat;
             j.geocoding = kestrel::ogc::cs::GeocodingInfo::NorthUp(520000, 5040000, 0.5, 0.5);
         },
         "outside the image"},
        {"missing channel",
         [](TorthoJob& j) {
             j.channels = {1, 4};
         },
         "channel 4 of"},
        {"unknown method", [](TorthoJob& j) { j.resampling = "lanczos"; }, "\"lanczos\""},
        {"no model", [](TorthoJob& j) { j.model = nullptr; }, "no math model"},
    };
    for (const auto& c : cases) {
        TorthoJob job = Job();
        c.spoil(job);
        const std::string what = testsupport::ThrownMessage<DataException>(
            [&] { TorthoGenerator().Generate(job); }, c.what);
        EXPECT_TRUE(testsupport::Contains(what, c.message)) << c.what << ": " << what;
        ExpectNoOutputs(dir);
    }
}

}  // namespace
