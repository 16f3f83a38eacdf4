// The sensor models the platform builds from a raster's own georeferencing.
#pragma once

#include <array>
#include <memory>
#include <string>

#include <kestrel/mathmodel.h>

#include <gdal.h>
class OGRSpatialReference;

namespace kestrel {
namespace mathmodel {

// Rational polynomial coefficients (RPC00B term order) over WGS 84 longitude, latitude and
// ellipsoidal height. Image to ground solves the polynomials by Newton's method at the given
// height.
std::unique_ptr<IMathModel> MakeRpcModel(const GDALRPCInfoV2& rpc, unsigned int width,
                                         unsigned int height, const std::string& path);

// Polynomials fitted to ground control points by least squares, one each way: order 1 for fewer
// than 10 points, order 2 from 10 on. Heights are ignored.
std::unique_ptr<IMathModel> MakeGcpModel(const GDAL_GCP* gcps, int count,
                                         const OGRSpatialReference* srs, unsigned int width,
                                         unsigned int height, const std::string& path);

// An image that is already georeferenced: the affine geotransform. Heights are ignored.
std::unique_ptr<IMathModel> MakeGeoTransformModel(const std::array<double, 6>& geoTransform,
                                                  const OGRSpatialReference* srs,
                                                  unsigned int width, unsigned int height);

}  // namespace mathmodel
}  // namespace kestrel

namespace kestrel {
namespace mathmodel {

// The model of the raster at path (see GetSrcModel for what segment selects).
std::unique_ptr<IMathModel> OpenSourceModel(const std::string& path, int segment);

}  // namespace mathmodel
}  // namespace kestrel
