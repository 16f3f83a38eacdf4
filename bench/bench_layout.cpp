// The ortho layout and footprint of a 20,000 x 20,000 RPC image over a 10,000 x 10,000 DEM,
// next to GDAL's GDALSuggestedWarpOutput2 with the RPC transformer and RPC_DEM on the same
// inputs. Each side runs in a process of its own so that its peak memory is its own.
//
//   bench_layout            generates the inputs once (kept between runs) and runs both sides
//   bench_layout ours|gdal  runs one side
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>

#include <gdal_alg.h>
#include <gdal_priv.h>

#include <kestrel/dem.h>
#include <silvan/silvan.h>

#include "../tests/rpcscene.h"
#include "support.h"

namespace {

constexpr unsigned int kImageSide = 20000;
constexpr int kDemSide = 10000;

std::string Input(const char* name) {
    return (benchsupport::ScratchDir("layout") / name).string();
}

void MakeInputs() {
    if (!std::filesystem::exists(Input("image.tif")))
        rpcscene::WriteRpcImage(Input("image.tif"), kImageSide, kImageSide);
    if (!std::filesystem::exists(Input("dem.tif"))) {
        std::printf("writing a %d x %d Float32 DEM (once)...\n", kDemSide, kDemSide);
        std::fflush(stdout);
        rpcscene::WriteDem(Input("dem.tif.part"), rpcscene::kDemLeft, rpcscene::kDemTop,
                           rpcscene::kDemSize / kDemSide, kDemSide, kDemSide, rpcscene::Hills);
        std::filesystem::rename(Input("dem.tif.part"), Input("dem.tif"));
    }
}

double Seconds(std::chrono::steady_clock::time_point since) {
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - since).count();
}

void Report(const char* side, double seconds, const double gt[6], unsigned int pixels,
            unsigned int lines) {
    std::printf("%-6s %8.3f s  peak %6.1f MB  %u x %u pixels of %.4f m, origin (%.2f, %.2f)\n",
                side, seconds, benchsupport::PeakMemoryBytes() / 1048576.0, pixels, lines, gt[1],
                gt[0], gt[3]);
}

int RunOurs() {
    const auto start = std::chrono::steady_clock::now();
    std::unique_ptr<kestrel::mathmodel::IMathModel> model(GetMathModel(Input("image.tif"), 0));
    std::unique_ptr<kestrel::dem::IRasterDEM> dem(kestrel::dem::DEMFactory::CreateFileRasterDEM(
        Input("dem.tif"), 1, 0.0, 1.0, NAN, kestrel::ogc::cs::DatumEllipsoid, false, 16));
    const double opening = Seconds(start);
    kestrel::ogc::cs::ICRS* crs = nullptr;
    kestrel::ogc::cs::GeocodingInfo* geocoding = nullptr;
    kestrel::tin::Polygon<double>* footprint = nullptr;
    unsigned int pixels = 0, lines = 0;
    GetOrthoParams(0, "", "EPSG:32632", 0.0, 0.0, nullptr, model.get(), {}, dem.get(), 0.0f, crs,
                   geocoding, pixels, lines, footprint);
    const double seconds = Seconds(start);
    Report("ours", seconds, geocoding->GetGeoTransform().data(), pixels, lines);
    std::printf(
        "       of which %.3f s opening the image's model and the DEM; footprint of %u "
        "vertices\n",
        opening, footprint->numPoints);
    delete crs;
    delete geocoding;
    delete footprint;
    return 0;
}

int RunGdal() {
    GDALAllRegister();
    const auto start = std::chrono::steady_clock::now();
    GDALDatasetH source = GDALOpen(Input("image.tif").c_str(), GA_ReadOnly);
    const std::string demOption = "RPC_DEM=" + Input("dem.tif");
    const char* options[] = {"METHOD=RPC", demOption.c_str(), "RPC_DEMINTERPOLATION=bilinear",
                             "DST_SRS=EPSG:32632", nullptr};
    void* transformer =
        GDALCreateGenImgProjTransformer2(source, nullptr, const_cast<char**>(options));
    if (transformer == nullptr) {
        std::fprintf(stderr, "gdal: no transformer: %s\n", CPLGetLastErrorMsg());
        return 1;
    }
    double gt[6], extent[4];
    int pixels = 0, lines = 0;
    const CPLErr err = GDALSuggestedWarpOutput2(source, GDALGenImgProjTransform, transformer, gt,
                                                &pixels, &lines, extent, 0);
    const double seconds = Seconds(start);
    GDALDestroyGenImgProjTransformer(transformer);
    GDALClose(source);
    if (err != CE_None) {
        std::fprintf(stderr, "gdal: %s\n", CPLGetLastErrorMsg());
        return 1;
    }
    Report("gdal", seconds, gt, static_cast<unsigned int>(pixels),
           static_cast<unsigned int>(lines));
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    const std::string mode = argc > 1 ? argv[1] : "";
    if (mode == "ours")
        return RunOurs();
    if (mode == "gdal")
        return RunGdal();
    MakeInputs();
    std::printf("layout of a %u x %u RPC image over a %d x %d DEM (%s)\n", kImageSide, kImageSide,
                kDemSide, kDemSide, Input("").c_str());
    std::fflush(stdout);
    const std::string self = std::string("\"") + argv[0] + "\"";
    const int ours = std::system((self + " ours").c_str());
    const int gdal = std::system((self + " gdal").c_str());
    return ours == 0 && gdal == 0 ? 0 : 1;
}
