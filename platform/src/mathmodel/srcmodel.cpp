#include <array>
#include <memory>
#include <string>

#include <cpl_vsi.h>
#include <gdal.h>
#include <gdal_priv.h>

#include <kestrel/exception.h>

#include <kestrel/gdalsupport.h>
#include "models.h"

namespace kestrel {
namespace mathmodel {

namespace {

enum Segment { kAny = 0, kRpc = 1, kGcp = 2, kGeoTransform = 3, kCamera = 4 };

const char* SegmentName(int segment) {
    switch (segment) {
        case kRpc:
            return "RPC coefficients";
        case kGcp:
            return "ground control points";
        case kGeoTransform:
            return "a geotransform";
        case kCamera:
            return "camera side file (IMAGE.camera.json)";
        default:
            return "a camera side file, RPC coefficients, ground control points or a "
                   "geotransform";
    }
}

}  // namespace

std::unique_ptr<IMathModel> OpenSourceModel(const std::string& path, int segment) {
    if (segment > kCamera) {
        KESTREL_THROW(ParameterException, "segment", ParameterException::Unsupported,
                      std::to_string(segment), "0 or less, 1, 2, 3 or 4",
                      FormatString("Math-model segment %d of \"%s\" is not one of 1 (RPC), 2 "
                                   "(GCP), 3 (geotransform), 4 (camera side file) or 0 (the "
                                   "first found)",
                                   segment, path.c_str()));
    }
    gdalsupport::EnsureRegistered();
    VSIStatBufL stat;
    if (path.empty() || VSIStatL(path.c_str(), &stat) != 0) {
        KESTREL_THROW(FileNotFoundException, path,
                      FormatString("The source raster \"%s\" does not exist", path.c_str()));
    }
    gdalsupport::ErrorCapture errors;
    std::unique_ptr<GDALDataset> dataset(
        GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
    if (!dataset) {
        KESTREL_THROW(DataException, FormatString("GDAL cannot open \"%s\" as a raster: %s",
                                                  path.c_str(), errors.Reason().c_str()));
    }
    const auto width = static_cast<unsigned int>(dataset->GetRasterXSize());
    const auto height = static_cast<unsigned int>(dataset->GetRasterYSize());

    const std::string cameraFile = CameraSideFile(path);
    if ((segment <= kAny || segment == kCamera) && VSIStatL(cameraFile.c_str(), &stat) == 0)
        return ReadCameraFile(cameraFile, path);
    if (segment <= kAny || segment == kRpc) {
        char** rpcDomain = dataset->GetMetadata("RPC");
        GDALRPCInfoV2 rpc;
        if (rpcDomain != nullptr && GDALExtractRPCInfoV2(rpcDomain, &rpc))
            return MakeRpcModel(rpc, width, height, path);
    }
    if ((segment <= kAny || segment == kGcp) && dataset->GetGCPCount() > 0) {
        return MakeGcpModel(dataset->GetGCPs(), dataset->GetGCPCount(), dataset->GetGCPSpatialRef(),
                            width, height, path);
    }
    std::array<double, 6> geoTransform{};
    if ((segment <= kAny || segment == kGeoTransform) &&
        dataset->GetGeoTransform(geoTransform.data()) == CE_None) {
        return MakeGeoTransformModel(geoTransform, dataset->GetSpatialRef(), width, height);
    }
    KESTREL_THROW(DataException, FormatString("\"%s\" has no math model: no %s found", path.c_str(),
                                              SegmentName(segment)));
}

}  // namespace mathmodel
}  // namespace kestrel
