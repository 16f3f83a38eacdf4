// Sensor (math) models: the relation between image positions and ground points.
#pragma once

#include <array>
#include <cstddef>
#include <memory>
#include <string>

#include <kestrel/crs.h>
#include <kestrel/export.h>

namespace kestrel {
namespace mathmodel {

// Image positions are continuous pixel/line coordinates as in GeocodingInfo: (0, 0) is the
// top-left corner of the image, the centre of the first pixel is (0.5, 0.5). Ground points are
// in GetCRS() coordinates with heights in its vertical datum. The const operations may run on
// several threads at once.
class KESTREL_API IMathModel {
  public:
    virtual ~IMathModel();
    IMathModel(const IMathModel&) = delete;
    IMathModel& operator=(const IMathModel&) = delete;

    // The ground coordinate system, its vertical datum included.
    virtual const ogc::cs::ICRS* GetCRS() const = 0;
    virtual unsigned int GetImageWidth() const = 0;
    virtual unsigned int GetImageHeight() const = 0;

    // Ground to image for n points; ok[i] is false where the model has no answer.
    virtual void GroundToImage(std::size_t n, const double* x, const double* y, const double* z,
                               double* pixel, double* line, bool* ok) const = 0;
    // Image to ground at the given heights.
    virtual void ImageToGround(std::size_t n, const double* pixel, const double* line,
                               const double* z, double* x, double* y, bool* ok) const = 0;

  protected:
    IMathModel() = default;
};


// ---------------------------------------------------------------------------------------------
// Frame cameras (docs/cameras.md)

// The lens of a frame camera: a pinhole with Brown-Conrady distortion (k1, k2, k3 radial, p1, p2
// tangential), or the equidistant fisheye (k1 to k4 on the angle from the axis), both as OpenCV
// defines them.
enum class LensType { Brown, Fisheye };

// The interior orientation in OpenCV's convention: camera axes x right, y down, z forward;
// focal lengths and principal point in pixels, the principal point counted with (0, 0) at the
// centre of the first pixel (OpenCV's convention; the model's image positions put (0, 0) at its
// corner, so column = u + 0.5).
struct CameraIntrinsics {
    LensType lens = LensType::Brown;
    unsigned int width = 0, height = 0;
    double fx = 0, fy = 0, cx = 0, cy = 0;
    double k1 = 0, k2 = 0, k3 = 0, k4 = 0;  // k4: fisheye only
    double p1 = 0, p2 = 0;                  // Brown only
};

// The exterior orientation: p_cam = R (P - C), with P and C in a Cartesian frame on the ground.
struct CameraPose {
    // The CRS of the centre (with its vertical datum), which is also the model's ground CRS.
    std::string crs;
    enum class Frame {
        // The local map frame at the centre: x along the CRS's grid east, y along its grid north
        // (true east and north for a geographic CRS), z up along the ellipsoid's normal.
        // centre holds C in crs.
        LocalGrid,
        // The east-north-up frame at origin (longitude, latitude, ellipsoidal height on WGS 84):
        // centre holds C in that frame, in metres.
        Topocentric
    } frame = Frame::LocalGrid;
    std::array<double, 3> origin{};
    std::array<double, 3> centre{};
    std::array<double, 9> rotation{1, 0, 0, 0, 1, 0, 0, 0, 1};  // R, row by row
};

// A frame camera as a math model. Ground to image is direct; image to ground intersects the ray
// with the surface of the given height. The projection runs in the Cartesian frame of the CRS's
// datum (PROJ takes ground points there, geoid heights included), so map-projection scale,
// meridian convergence and earth curvature are accounted for. Points behind the camera or beyond
// the field of view in which the lens's distortion is one-to-one have no image position.
// `what` names the image and file in error messages. Throws DataException for non-finite or
// impossible parameters and for a CRS that PROJ cannot take to its geocentric frame.
KESTREL_API std::unique_ptr<IMathModel> MakeFrameCameraModel(const CameraIntrinsics& intrinsics,
                                                             const CameraPose& pose,
                                                             const std::string& what);

// R (world to OpenCV camera axes) of the classical photogrammetric angles, in degrees: the image
// frame has x right, y up and looks down its -z axis; M = R3(kappa) R2(phi) R1(omega) takes world
// (x east, y north, z up) to that frame with R1(w) = [1 0 0; 0 cos w sin w; 0 -sin w cos w],
// R2(p) = [cos p 0 -sin p; 0 1 0; sin p 0 cos p], R3(k) = [cos k sin k 0; -sin k cos k 0; 0 0 1];
// R = diag(1, -1, -1) M.
KESTREL_API std::array<double, 9> RotationFromOpk(double omega, double phi, double kappa);
// Omega, phi, kappa in degrees of such an R (phi within [-90, 90]).
KESTREL_API std::array<double, 3> OpkFromRotation(const std::array<double, 9>& rotation);
// R of a rotation vector (axis times angle in radians), as OpenCV's Rodrigues.
KESTREL_API std::array<double, 9> RotationFromAxisAngle(const std::array<double, 3>& vector);

// The side file of an image: its name without the extension, then ".camera.json".
KESTREL_API std::string CameraSideFile(const std::string& imagePath);

// Reads a camera side file; the size of the image at imagePath, when given, is checked against
// the camera's.
KESTREL_API std::unique_ptr<IMathModel> ReadCameraFile(const std::string& path,
                                                       const std::string& imagePath = "");

// Writes a camera side file whole (under a temporary name, then renamed).
KESTREL_API void WriteCameraFile(const std::string& path, const CameraIntrinsics& intrinsics,
                                 const CameraPose& pose);

// The camera of an image from a file of many: an OpenSfM reconstruction (.json) or an
// exterior-orientation table with crs the CRS of its centres (see docs/cameras.md). Throws
// DataException naming the file and the image when the image is not in it, its size differs,
// or its lens type is unknown.
KESTREL_API std::unique_ptr<IMathModel> OpenCameraModel(const std::string& imagePath,
                                                        const std::string& camerasFile,
                                                        const std::string& crs);

}  // namespace mathmodel
}  // namespace kestrel
