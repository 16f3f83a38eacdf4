// Resamplers against gdalwarp on the same output grid, and their handling of no-data.
#include <cmath>
#include <cstdio>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include <gdal_priv.h>
#include <gtest/gtest.h>

#include <kestrel/rasterio.h>
#include <kestrel/resampler.h>
#include <silvan/utils.h>

#include "support.h"

using kestrel::datasources::BasicReader;
using kestrel::datasources::DataType;
using kestrel::gobs::Raster;
using kestrel::utils::IRasterResampler;
using testsupport::TempDir;

namespace {

constexpr int kWidth = 160;
constexpr int kHeight = 120;
constexpr double kLeft = 500000.0;
constexpr double kTop = 4100000.0;
constexpr double kPixel = 0.5;

// A three-channel byte image: smooth gradients, a sharp edge and noise, so that every kernel
// weight shows; no-data 0 when asked, with a few holes of no-data.
std::string MakeSource(const TempDir& dir, bool withNoData) {
    GDALAllRegister();
    const std::string path = dir.File(withNoData ? "holes.tif" : "source.tif");
    GDALDataset* ds = GetGDALDriverManager()->GetDriverByName("GTiff")->Create(
        path.c_str(), kWidth, kHeight, 3, GDT_Byte, nullptr);
    double gt[6] = {kLeft, kPixel, 0, kTop, 0, -kPixel};
    ds->SetGeoTransform(gt);
    OGRSpatialReference srs;
    srs.importFromEPSG(32632);
    ds->SetSpatialRef(&srs);
    std::mt19937 random(7);
    std::vector<unsigned char> values(kWidth * kHeight);
    for (int b = 1; b <= 3; ++b) {
        for (int y = 0; y < kHeight; ++y) {
            for (int x = 0; x < kWidth; ++x) {
                int v = (x * (b + 1) + y * 2) % 200 + static_cast<int>(random() % 40);
                if (x > 80 && y > 60)
                    v = 255 - v / 4;  // a sharp edge
                if (withNoData && ((x / 9 + y / 7) % 11 == 0))
                    v = 0;
                values[y * kWidth + x] = static_cast<unsigned char>(std::max(v, 1) * (v != 0));
            }
        }
        EXPECT_EQ(ds->GetRasterBand(b)->RasterIO(GF_Write, 0, 0, kWidth, kHeight, values.data(),
                                                 kWidth, kHeight, GDT_Byte, 0, 0, nullptr),
                  CE_None);
        if (withNoData)
            ds->GetRasterBand(b)->SetNoDataValue(0);
    }
    GDALClose(ds);
    return path;
}

struct Grid {
    double left;
    double top;
    double pixel;
    int width;
    int height;
};

// The output grid: shifted by a fraction of a pixel, with pixels `factor` times as large.
Grid TestGrid(double factor) {
    Grid g;
    g.pixel = kPixel * factor;
    g.left = kLeft + 0.37 * kPixel;
    g.top = kTop - 0.21 * kPixel;
    g.width = static_cast<int>((kWidth * kPixel - 0.37 * kPixel) / g.pixel);
    g.height = static_cast<int>((kHeight * kPixel - 0.21 * kPixel) / g.pixel);
    return g;
}

// gdalwarp's output on the grid, as doubles (band-sequential).
std::vector<double> Gdalwarp(const TempDir& dir, const std::string& source,
                             const std::string& method, const Grid& g) {
    const std::string out = dir.File("warp_" + method + ".tif");
    char command[2048];
    std::snprintf(command, sizeof command,
                  "gdalwarp -q -overwrite -r %s -wo NUM_THREADS=1 -te %.6f %.6f %.6f %.6f "
                  "-tr %.6f %.6f '%s' '%s'",
                  method.c_str(), g.left, g.top - g.height * g.pixel, g.left + g.width * g.pixel,
                  g.top, g.pixel, g.pixel, source.c_str(), out.c_str());
    EXPECT_EQ(std::system(command), 0) << command;
    GDALDataset* ds = GDALDataset::Open(out.c_str(), GDAL_OF_RASTER);
    std::vector<double> values(static_cast<std::size_t>(g.width) * g.height * 3, NAN);
    if (ds == nullptr) {
        ADD_FAILURE() << "gdalwarp made no " << out;
        return values;
    }
    EXPECT_EQ(ds->GetRasterXSize(), g.width);
    EXPECT_EQ(ds->GetRasterYSize(), g.height);
    EXPECT_EQ(ds->RasterIO(GF_Read, 0, 0, g.width, g.height, values.data(), g.width, g.height,
                           GDT_Float64, 3, nullptr, 0, 0, 0, nullptr),
              CE_None);
    GDALClose(ds);
    return values;
}

// Our values on the grid: the whole image as one window, byte rounding as GDAL's.
std::vector<double> Ours(const std::string& source, const std::string& method, const Grid& g,
                         bool withNoData) {
    BasicReader reader(source);
    std::unique_ptr<Raster> window(reader.ReadWindow(0, 0, kWidth, kHeight));
    std::string name = method;
    std::unique_ptr<IRasterResampler> resampler(GetResampler(name));
    resampler->SetSourceStep(g.pixel / kPixel, g.pixel / kPixel);
    const std::size_t n = static_cast<std::size_t>(g.width) * g.height;
    std::vector<double> x(n);
    std::vector<double> y(n);
    for (int j = 0; j < g.height; ++j) {
        for (int i = 0; i < g.width; ++i) {
            x[j * g.width + i] = (g.left + (i + 0.5) * g.pixel - kLeft) / kPixel;
            y[j * g.width + i] = (kTop - (g.top - (j + 0.5) * g.pixel)) / kPixel;
        }
    }
    std::vector<double> values(n * 3);
    const double noData[3] = {0, 0, 0};
    resampler->ResampleAll(*window, n, x.data(), y.data(), values.data(),
                           withNoData ? noData : nullptr);
    for (double& v : values) {
        if (!std::isnan(v))
            v = std::min(255.0, std::max(0.0, std::floor(v + 0.5)));
    }
    return values;
}

struct Comparison {
    double maxDifference = 0;
    std::size_t differing = 0;
    std::size_t compared = 0;
    std::size_t onlyOurs = 0;  // a value where GDAL has none
};

Comparison Compare(const std::vector<double>& ours, const std::vector<double>& theirs,
                   bool withNoData) {
    Comparison result;
    for (std::size_t i = 0; i < ours.size(); ++i) {
        const bool theirsMissing = std::isnan(theirs[i]) || (withNoData && theirs[i] == 0);
        if (std::isnan(ours[i]) || theirsMissing) {
            result.onlyOurs += !std::isnan(ours[i]) && theirsMissing;
            continue;
        }
        ++result.compared;
        const double d = std::fabs(ours[i] - theirs[i]);
        result.maxDifference = std::max(result.maxDifference, d);
        result.differing += d > 0;
    }
    return result;
}

}  // namespace

// Pixel factor of the grid of each method: 1.13 (downsampling) where gdalwarp 3.6 applies the
// kernel GDAL documents. Its lanczos and cubicspline weights are not symmetric when it
// downsamples (an impulse comes out shifted by a pixel), so those two are compared on a grid of
// the source's pixel size, where the kernels are the same.
struct Case {
    const char* method;
    double factor;
};
const Case kCases[] = {{"near", 1.13},       {"bilinear", 1.13}, {"cubic", 1.13},
                       {"cubicspline", 1.0}, {"lanczos", 1.0},   {"average", 1.13},
                       {"mode", 1.13},       {"bilinear", 0.8},  {"cubic", 1.0}};

// near equal; every other method within 1 (the rounding of the last bit). With pixels of value
// 0 as no-data in the source: no value mixes them in, and a position on a no-data pixel has no
// value, as with gdalwarp.
TEST(Resampler, GivesGdalwarpsValuesOnTheSameGridAndNeverMixesNoDataIn) {
    TempDir dir;
    for (const bool noData : {false, true}) {
        const std::string source = MakeSource(dir, noData);
        for (const Case& test : kCases) {
            SCOPED_TRACE(std::string(test.method) + " " + std::to_string(test.factor) +
                         (noData ? " no-data" : ""));
            const Grid g = TestGrid(test.factor);
            const Comparison c = Compare(Ours(source, test.method, g, noData),
                                         Gdalwarp(dir, source, test.method, g), noData);
            if (!noData) {
                EXPECT_GT(c.compared, 3u * (g.width - 2) * (g.height - 2));
            }
            EXPECT_LE(c.maxDifference, std::string(test.method) == "near" ? 0.0 : 1.0)
                << c.differing << " of " << c.compared << " differ";
            EXPECT_EQ(c.onlyOurs, 0u);
        }
    }
}

// A window read with the resampler's margin gives the values of the whole image; positions
// outside the window have none.
TEST(Resampler, WindowWithTheMarginGivesTheWholeImagesValues) {
    TempDir dir;
    BasicReader reader(MakeSource(dir, false));
    std::unique_ptr<Raster> whole(reader.ReadWindow(0, 0, kWidth, kHeight));
    for (const char* method : {"near", "bilinear", "cubic", "cubicspline", "lanczos", "average"}) {
        SCOPED_TRACE(method);
        std::unique_ptr<IRasterResampler> resampler(
            kestrel::utils::ResamplerFactory().GetResampler(method));
        resampler->SetSourceStep(1.7, 1.3);
        const unsigned int r = resampler->GetRadius();
        // Positions inside pixels 40..59 x 30..49.
        std::vector<double> x;
        std::vector<double> y;
        for (double v = 40.01; v < 60.0; v += 0.77) {
            x.push_back(v);
            y.push_back(30.02 + (v - 40.0));
        }
        std::unique_ptr<Raster> part(reader.ReadWindow(40 - r, 30 - r, 20 + 2 * r, 20 + 2 * r));
        std::vector<double> expected(x.size() * 3);
        std::vector<double> got(x.size() * 3);
        resampler->ResampleAll(*whole, x.size(), x.data(), y.data(), expected.data(), nullptr);
        resampler->ResampleAll(*part, x.size(), x.data(), y.data(), got.data(), nullptr);
        for (std::size_t i = 0; i < got.size(); ++i)
            EXPECT_NEAR(got[i], expected[i], 1e-9) << i;
        const double outside[2] = {39.0 - r, 70.5};
        double values[2];
        resampler->Resample(*part, 1, 2, outside, outside, values, nullptr);
        EXPECT_TRUE(std::isnan(values[0]) && std::isnan(values[1]));
    }
}

TEST(Resampler, MethodsByGdalNamesWithoutRegardToCase) {
    for (std::string name :
         {"NEAR", "Nearest", "bilinear", "CubicSpline", "LANCZOS", "average", "Mode", "cubic"}) {
        const std::string before = name;
        std::unique_ptr<IRasterResampler> resampler(GetResampler(name));
        EXPECT_EQ(name, before);
        EXPECT_NE(resampler, nullptr);
    }
    std::unique_ptr<IRasterResampler> cubic(
        kestrel::utils::ResamplerFactory().GetResampler("CUBIC"));
    EXPECT_EQ(cubic->GetMethod(), "cubic");
    EXPECT_EQ(cubic->GetRadius(), 2u);
    cubic->SetSourceStep(2.5, 1.0);
    EXPECT_EQ(cubic->GetRadius(), 5u);
    EXPECT_THROW(cubic->SetSourceStep(0, 1), kestrel::DataException);
    EXPECT_THROW(cubic->SetSourceStep(1, NAN), kestrel::DataException);
    for (std::string name : {"gauss", "", "bilinear "}) {
        if (const auto e = testsupport::Thrown<kestrel::ParameterException>(
                [&] { delete GetResampler(name); }, name)) {
            EXPECT_EQ(e->GetParameterName(), name);
            EXPECT_EQ(e->GetType(), kestrel::ParameterException::Unsupported);
            EXPECT_EQ(e->GetValue(), "");
            EXPECT_EQ(e->GetExpected(), "");
            EXPECT_EQ(e->GetErrorMessage(), "Unsupported resampling method.");
            EXPECT_EQ(e->GetSourceFile(), "utils.cpp");
        }
    }
}
