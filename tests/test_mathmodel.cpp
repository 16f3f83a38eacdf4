// Sensor models of source rasters: RPC (tag and side files), GCP polynomials, geotransform.
#include <gtest/gtest.h>

#include <cmath>
#include <filesystem>
#include <memory>
#include <random>
#include <thread>
#include <vector>

#include <gdal_alg.h>
#include <gdal_priv.h>

#include <kestrel/crs.h>
#include <kestrel/exception.h>
#include <kestrel/orthoutils.h>
#include <silvan/utils.h>

#include "rpcscene.h"
#include "support.h"

using kestrel::mathmodel::IMathModel;
using testsupport::Contains;
using testsupport::TempDir;
using testsupport::ThrownMessage;

namespace {

std::unique_ptr<IMathModel> Model(const std::string& path, int segment = 0) {
    return std::unique_ptr<IMathModel>(GetSrcModel(path, "", segment));
}

struct GdalRpc {
    explicit GdalRpc(const std::string& path) {
        std::unique_ptr<GDALDataset> ds(GDALDataset::Open(path.c_str(), GDAL_OF_RASTER));
        GDALRPCInfoV2 rpc;
        GDALExtractRPCInfoV2(ds->GetMetadata("RPC"), &rpc);
        transformer = GDALCreateRPCTransformerV2(&rpc, FALSE, 0.0, nullptr);
    }
    ~GdalRpc() { GDALDestroyRPCTransformer(transformer); }
    void* transformer;
};

// Random ground points over the scene at heights from 100 m to 400 m.
void GroundPoints(std::size_t n, std::vector<double>& lon, std::vector<double>& lat,
                  std::vector<double>& h) {
    std::mt19937 random(7);
    std::uniform_real_distribution<double> u(-1.0, 1.0);
    for (std::size_t i = 0; i < n; ++i) {
        lon.push_back(9.19 + 0.009 * u(random));
        lat.push_back(45.46 + 0.0045 * u(random));
        h.push_back(250.0 + 150.0 * u(random));
    }
}

}  // namespace

// The RPC model agrees with GDAL's RPC transformer both ways, however the coefficients are
// stored: in the TIFF tag, in an .RPB side file, or in an _RPC.TXT side file.
TEST(RpcModel, AgreesWithGdalForEveryWayOfStoringTheCoefficients) {
    TempDir dir;
    const std::vector<std::pair<std::string, std::vector<std::string>>> cases = {
        {"tag.tif", {}},
        {"rpb.tif", {"PROFILE=GeoTIFF", "RPB=YES"}},
        {"rpctxt.tif", {"PROFILE=GeoTIFF", "RPCTXT=YES"}},
    };
    std::vector<double> lon, lat, h;
    GroundPoints(500, lon, lat, h);
    for (const auto& c : cases) {
        SCOPED_TRACE(c.first);
        const std::string path = dir.File(c.first);
        rpcscene::WriteRpcImage(path, 1000, 800, c.second);
        if (c.first == "rpb.tif") {
            ASSERT_TRUE(std::filesystem::exists(dir.File("rpb.RPB")));
        } else if (c.first == "rpctxt.tif") {
            ASSERT_TRUE(std::filesystem::exists(dir.File("rpctxt_RPC.TXT")));
        }
        const auto model = Model(path);
        EXPECT_EQ(model->GetImageWidth(), 1000u);
        EXPECT_EQ(model->GetImageHeight(), 800u);
        EXPECT_EQ(kestrel::ogc::utils::GetVerticalDatumType(model->GetCRS()),
                  kestrel::ogc::cs::DatumEllipsoid);

        const std::size_t n = lon.size();
        std::vector<double> px(n), ln(n);
        std::unique_ptr<bool[]> ok(new bool[n]);
        model->GroundToImage(n, lon.data(), lat.data(), h.data(), px.data(), ln.data(), ok.get());
        GdalRpc gdal(path);
        std::vector<double> gx = lon, gy = lat, gz = h;
        std::vector<int> gok(n);
        GDALRPCTransform(gdal.transformer, TRUE, static_cast<int>(n), gx.data(), gy.data(),
                         gz.data(), gok.data());
        for (std::size_t i = 0; i < n; ++i) {
            ASSERT_TRUE(ok[i] && gok[i]);
            EXPECT_NEAR(px[i], gx[i], 1e-6);
            EXPECT_NEAR(ln[i], gy[i], 1e-6);
        }
        // Back to the ground at the same heights.
        std::vector<double> bx(n), by(n);
        model->ImageToGround(n, px.data(), ln.data(), h.data(), bx.data(), by.data(), ok.get());
        for (std::size_t i = 0; i < n; ++i) {
            ASSERT_TRUE(ok[i]);
            EXPECT_NEAR(bx[i], lon[i], 1e-8);  // about a millimetre
            EXPECT_NEAR(by[i], lat[i], 1e-8);
        }
    }
}

// Several threads share one model; each gets the answers a single thread gets.
TEST(RpcModel, ConstOperationsGiveTheSameAnswersOnSeveralThreads) {
    TempDir dir;
    rpcscene::WriteRpcImage(dir.File("a.tif"), 1000, 800);
    const auto model = Model(dir.File("a.tif"));
    std::vector<double> lon, lat, h;
    GroundPoints(2000, lon, lat, h);
    const std::size_t n = lon.size();
    std::vector<double> px(n), ln(n);
    std::unique_ptr<bool[]> ok(new bool[n]);
    model->GroundToImage(n, lon.data(), lat.data(), h.data(), px.data(), ln.data(), ok.get());
    std::vector<int> mismatches(2, 0);
    std::vector<std::thread> threads;
    for (int t = 0; t < 2; ++t) {
        threads.emplace_back([&, t] {
            std::vector<double> x(n), y(n);
            std::unique_ptr<bool[]> good(new bool[n]);
            for (int round = 0; round < 5; ++round) {
                model->ImageToGround(n, px.data(), ln.data(), h.data(), x.data(), y.data(),
                                     good.get());
                for (std::size_t i = 0; i < n; ++i)
                    mismatches[t] += std::fabs(x[i] - lon[i]) > 1e-8 || !good[i];
            }
        });
    }
    for (auto& thread : threads)
        thread.join();
    EXPECT_EQ(mismatches[0] + mismatches[1], 0);
}

TEST(SourceModels, GcpPolynomialAndGeotransformRelateImageAndGround) {
    TempDir dir;
    GDALAllRegister();
    GDALDriver* gtiff = GetGDALDriverManager()->GetDriverByName("GTiff");
    OGRSpatialReference utm;
    utm.importFromEPSG(32632);
    // Ground control points on an affine relation: the order-1 polynomial is exact.
    {
        std::unique_ptr<GDALDataset> ds(
            gtiff->Create(dir.File("gcp.tif").c_str(), 400, 300, 1, GDT_Byte, nullptr));
        std::vector<GDAL_GCP> gcps(5);
        const double positions[5][2] = {{0, 0}, {400, 0}, {400, 300}, {0, 300}, {200, 150}};
        for (int i = 0; i < 5; ++i) {
            GDALInitGCPs(1, &gcps[i]);
            gcps[i].dfGCPPixel = positions[i][0];
            gcps[i].dfGCPLine = positions[i][1];
            gcps[i].dfGCPX = 514000 + 0.5 * positions[i][0] + 0.1 * positions[i][1];
            gcps[i].dfGCPY = 5034000 - 0.5 * positions[i][1];
        }
        ds->SetGCPs(5, gcps.data(), &utm);
        GDALDeinitGCPs(5, gcps.data());
    }
    {
        std::unique_ptr<GDALDataset> ds(
            gtiff->Create(dir.File("geo.tif").c_str(), 400, 300, 1, GDT_Byte, nullptr));
        double gt[6] = {514000, 0.5, 0, 5034000, 0, -0.5};
        ds->SetGeoTransform(gt);
        ds->SetSpatialRef(&utm);
    }
    const struct {
        const char* file;
        double x;  // ground position of image position (100, 50)
        double y;
    } cases[] = {{"gcp.tif", 514055.0, 5033975.0}, {"geo.tif", 514050.0, 5033975.0}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.file);
        const auto model = Model(dir.File(c.file));
        ASSERT_NE(model->GetCRS(), nullptr);
        EXPECT_TRUE(model->GetCRS()->IsProjected());
        const double px = 100, ln = 50, z = 1000;
        double x, y, p, l;
        bool ok;
        model->ImageToGround(1, &px, &ln, &z, &x, &y, &ok);
        ASSERT_TRUE(ok);
        EXPECT_NEAR(x, c.x, 1e-6);
        EXPECT_NEAR(y, c.y, 1e-6);
        model->GroundToImage(1, &x, &y, &z, &p, &l, &ok);
        EXPECT_NEAR(p, 100.0, 1e-6);
        EXPECT_NEAR(l, 50.0, 1e-6);
    }
}

// The segment number picks the kind of model; 0 takes the first found (RPC before the
// geotransform); a kind the file lacks, a file without any model and an unknown segment are
// refused with what was looked for and where.
TEST(SourceModels, SegmentSelectsTheKindAndMissingModelsAreNamed) {
    TempDir dir;
    const std::string both = dir.File("both.tif");
    rpcscene::WriteRpcImage(both, 100, 80);
    {
        std::unique_ptr<GDALDataset> ds(GDALDataset::Open(both.c_str(), GDAL_OF_UPDATE));
        double gt[6] = {514000, 1, 0, 5034000, 0, -1};
        ds->SetGeoTransform(gt);
    }
    EXPECT_TRUE(Model(both, 0)->GetCRS()->IsGeographic());
    EXPECT_TRUE(Model(both, 1)->GetCRS()->IsGeographic());
    EXPECT_EQ(Model(both, 3)->GetCRS(), nullptr);  // a geotransform without a CRS
    const std::string noGcps = ThrownMessage<kestrel::DataException>([&] { Model(both, 2); });
    EXPECT_TRUE(Contains(noGcps, "ground control points") && Contains(noGcps, both)) << noGcps;
    const std::string plain = dir.File("plain.tif");
    {
        std::unique_ptr<GDALDataset> ds(GetGDALDriverManager()->GetDriverByName("GTiff")->Create(
            plain.c_str(), 10, 10, 1, GDT_Byte, nullptr));
    }
    const std::string none = ThrownMessage<kestrel::DataException>([&] { Model(plain); });
    EXPECT_TRUE(Contains(none, "has no math model") &&
                Contains(none, "RPC coefficients, ground control points or a geotransform"))
        << none;
    EXPECT_THROW(Model(dir.File("missing.tif")), kestrel::FileNotFoundException);
    EXPECT_THROW(Model(both, 5), kestrel::ParameterException);
    // The library's own entry point hands the segment on.
    std::unique_ptr<IMathModel> viaLibrary(GetMathModel(both, 3));
    EXPECT_EQ(viaLibrary->GetCRS(), nullptr);
}

TEST(MapunitsToCRS, TakesWhatOgrTakesAndQuotesWhatNamesNoCRS) {
    for (const char* text :
         {"EPSG:32632", "+proj=utm +zone=32 +datum=WGS84 +units=m +no_defs", "WGS84"}) {
        std::unique_ptr<kestrel::ogc::cs::ICRS> crs(kestrel::ogc::utils::MapunitsToCRS(text));
        EXPECT_FALSE(crs->GetWKT().empty()) << text;
        // WKT given back is taken too.
        std::unique_ptr<kestrel::ogc::cs::ICRS> again(
            kestrel::ogc::utils::MapunitsToCRS(crs->GetWKT()));
        EXPECT_TRUE(again->IsSame(*crs)) << text;
    }
    EXPECT_TRUE(Contains(ThrownMessage<kestrel::DataException>(
                             [] { delete kestrel::ogc::utils::MapunitsToCRS("Non"); }),
                         "\"Non\""));
}
