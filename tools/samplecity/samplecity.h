// A synthetic city for examples, tests and benchmarks: a surface model (DSM) with box buildings,
// oblique frame-camera images rendered by casting rays through it onto a procedural texture,
// each image's camera in its side file and RPC coefficients fitted to it, and the master
// parameter file that names the images.
//
// Heights are ellipsoidal (WGS 84) in a UTM coordinate system without a vertical part, which is
// how both GDAL's RPC transformer and the platform read such a DSM: RPC heights are ellipsoidal
// too, so no geoid enters anywhere.
#pragma once

#include <array>
#include <cstdint>
#include <limits>
#include <memory>
#include <string>
#include <vector>

#include <kestrel/crs.h>
#include <kestrel/elevation.h>
#include <kestrel/mathmodel.h>

namespace samplecity {

// A building: a flat roof at `height` metres above the ground over [x0, x1] x [y0, y1] (metres
// from the west and south edges of the scene).
struct Building {
    double x0, y0, x1, y1;
    double height;
};

// A frame camera that looks at a ground point (the scene centre unless given) from a side. Seen
// straight down (off nadir 0), the azimuth is where the top of the image points.
struct CameraSpec {
    std::string name;        // the image is <name>.tif
    double azimuthDegrees;   // direction from the target to the camera, from north
    double offNadirDegrees;  // angle between the viewing direction and the vertical
    double altitude;         // metres above the ground at the target
    unsigned int width, height;
    double groundSampleDistance;  // metres per pixel at the target
    // The target in metres from the west and south edges of the scene; NaN: the scene centre.
    double targetX = std::numeric_limits<double>::quiet_NaN();
    double targetY = std::numeric_limits<double>::quiet_NaN();
};

struct CityOptions {
    std::string crs = "EPSG:32632";
    double west = 514800.0, south = 5033800.0;  // lower-left corner of the DSM
    double sizeX = 240.0, sizeY = 240.0;        // metres
    double dsmPixel = 0.5;                      // metres
    double groundHeight = 250.0;                // ellipsoidal height at the south-west corner
    double slopeX = 0.0, slopeY = 0.0;          // gentle terrain: metres of rise per metre
    std::vector<Building> buildings;
    std::vector<CameraSpec> cameras;
    std::uint64_t seed = 7;  // varies the texture, the exposures and the DSM's errors
    // Each image's exposure: its colours times a gain drawn within 1 +- exposureSpread / 100
    // (ExposureGain); 0: every gain is 1.
    double exposureSpread = 0.0;
    // The DSM handed to the workflow (dsm.tif) has every building edge moved in or out by 1 to
    // dsmError DSM pixels (PerturbedBuildings); the images are rendered from the true one,
    // written as dsm_true.tif. 0: dsm.tif is the true DSM.
    unsigned int dsmError = 0;
    // > 0: also write ideal.tif, the texture seen from straight above on a grid of this pixel
    // size over the DSM's extent (RenderIdeal).
    double idealPixel = 0.0;
};

// The default sample: a block of buildings of 6 to 30 m on gently sloping ground, four images
// seen from north, east, south and west.
CityOptions SmallCity();
// One box building on flat ground, seen from the given sides (azimuths in degrees).
CityOptions BoxScene(double boxHeight, const std::vector<double>& azimuths,
                     double offNadirDegrees = 30.0, unsigned int imageSize = 384);

// A large town for benchmarks: one image of imageSize x imageSize pixels at 0.5 m, seen 20
// degrees off nadir from 2500 m, over a 1 m DSM 1.2 times the image's width, with a building every 40 m.
CityOptions BenchCity(unsigned int imageSize);

// An aerial block: rows flight strips (west to east, one way and back) of cols nadir frame
// images each, imageSize pixels square at gsd metres, with 60 % forward and 30 % side overlap,
// flown at 1.2 times an image's ground width; over a DSM of 0.5 m that covers every image with
// a margin: city blocks between north-south streets, buildings of 3 to 24 m and a few towers of
// 30 to 50 m, on gently sloping ground.
CityOptions BlockCity(unsigned int rows, unsigned int cols, unsigned int imageSize = 1000,
                      double gsd = 0.15);

// The exposure gain of image `index` (seeded; 1 when options.exposureSpread is 0).
double ExposureGain(const CityOptions& options, std::size_t index);
// The buildings of the DSM handed to the workflow: options.buildings with each edge moved by 1
// to options.dsmError DSM pixels, in or out (seeded), keeping every building at least one pixel
// wide; the buildings themselves when dsmError is 0.
std::vector<Building> PerturbedBuildings(const CityOptions& options);

// The surface model as a grid, bilinear between posts at cell centres.
class Dsm {
  public:
    explicit Dsm(const CityOptions& options);
    // Ellipsoidal height at a ground point; the nearest edge value outside.
    double HeightAt(double x, double y) const;
    double Ground(double x, double y) const;  // the terrain without buildings
    double MaxHeight() const { return maxHeight_; }
    double MinHeight() const { return minHeight_; }
    // First intersection of the ray origin + t dir (t > 0) with the surface; false when it leaves
    // the DSM first.
    bool Intersect(const std::array<double, 3>& origin, const std::array<double, 3>& dir,
                   std::array<double, 3>& hit) const;
    // Index + 1 of the building at the post nearest the point, 0 for none.
    int BuildingAt(double x, double y) const;

    unsigned int Width() const { return width_; }
    unsigned int Height() const { return height_; }
    std::array<double, 6> GeoTransform() const;
    const std::vector<float>& Posts() const { return posts_; }
    const CityOptions& Options() const { return options_; }

  private:
    // The highest post of the 3 x 3 blocks around the one holding (x, y): no surface point within
    // (kBlock - 1) DSM pixels of (x, y) is higher.
    float NearbyMax(double x, double y) const;

    static constexpr unsigned int kBlock = 8;
    CityOptions options_;
    unsigned int width_, height_;
    std::vector<float> posts_;
    std::vector<float> blockMax_;  // per block of kBlock x kBlock posts: the 3 x 3 blocks' max
    unsigned int blocksX_ = 0, blocksY_ = 0;
    std::vector<int> buildingIds_;  // per post: index + 1 of its building, 0 for ground
    double minHeight_, maxHeight_;
};

// A pinhole camera standing over the scene, as the platform's frame-camera model: it projects in
// the earth's Cartesian frame, with its attitude given in the local map frame at its centre.
// Image coordinates are continuous with (0, 0) at the top-left corner of the first pixel, as GDAL
// counts them.
class FrameCamera {
  public:
    FrameCamera(const CameraSpec& spec, const Dsm& dsm);
    bool Project(double x, double y, double z, double& col, double& row) const;
    // The line of sight through an image position across the surface model's heights, as a
    // straight segment in the scene's coordinates (a line of sight bends by micrometres there):
    // from where it is 5 m above the highest surface point, unit direction.
    void Ray(double col, double row, std::array<double, 3>& origin,
             std::array<double, 3>& dir) const;
    // The same for n positions; origins and dirs hold 3 n values, NaN where the line of sight
    // does not come down through those heights.
    void Rays(std::size_t n, const double* col, const double* row, double* origins,
              double* dirs) const;
    const std::array<double, 3>& Centre() const { return pose_.centre; }
    const CameraSpec& Spec() const { return spec_; }
    const kestrel::mathmodel::CameraIntrinsics& Intrinsics() const { return intrinsics_; }
    const kestrel::mathmodel::CameraPose& Pose() const { return pose_; }
    const kestrel::mathmodel::IMathModel& Model() const { return *model_; }

  private:
    CameraSpec spec_;
    kestrel::mathmodel::CameraIntrinsics intrinsics_;
    kestrel::mathmodel::CameraPose pose_;
    std::unique_ptr<kestrel::mathmodel::IMathModel> model_;
    double top_, bottom_;  // heights of the ends of Ray's segments
};

// Rational polynomial coefficients in the RPC00B layout (offsets, scales, four times 20 terms).
// Line and sample address pixel centres: RPC value v is GDAL image coordinate v + 0.5.
struct Rpc {
    double lineOff = 0, sampOff = 0, latOff = 0, lonOff = 0, heightOff = 0;
    double lineScale = 1, sampScale = 1, latScale = 1, lonScale = 1, heightScale = 1;
    std::array<double, 20> lineNum{}, lineDen{}, sampNum{}, sampDen{};

    // Ground (longitude, latitude, ellipsoidal height) to RPC sample and line.
    void Evaluate(double lon, double lat, double h, double& samp, double& line) const;
    // The items of GDAL's "RPC" metadata domain, as NAME=VALUE texts.
    std::vector<std::string> ToMetadata() const;
    // From GDAL's "RPC" metadata items; throws DataException naming the first missing item.
    static Rpc FromMetadata(const std::vector<std::string>& items);
};

// Fits RPCs to the camera over its image and the height range [minHeight, maxHeight];
// maxResidual receives the largest fit error in pixels at the fit points.
Rpc FitRpc(const FrameCamera& camera, const kestrel::ogc::cs::ICRS& crs, double minHeight,
           double maxHeight, double* maxResidual = nullptr);

// Colour of the surface at a point: ground, roof or wall (three byte channels).
std::array<std::uint8_t, 3> Texture(const Dsm& dsm, double x, double y, double z,
                                    std::uint64_t seed);

// The texture seen from straight above (walls not seen) at the centres of a grid of width x
// height pixels with the given geotransform: RGB bytes, pixel-interleaved, row by row; 0 off the
// DSM. What a perfect true ortho of the sample shows, with every exposure gain 1.
std::vector<std::uint8_t> RenderIdeal(const Dsm& dsm, const std::array<double, 6>& geoTransform,
                                      unsigned int width, unsigned int height, std::uint64_t seed,
                                      unsigned int threads = 0);

struct SampleImage {
    std::string path;        // the GeoTIFF with its RPCs
    std::string cameraPath;  // its camera side file
    double rpcMaxResidual;  // pixels
    double gain = 1.0;      // its exposure gain (ExposureGain)
    std::unique_ptr<FrameCamera> camera;
};

struct Sample {
    std::string dsmPath;      // the DSM for the workflow
    std::string trueDsmPath;  // the DSM the images were rendered from (dsmPath without errors)
    std::string idealPath;    // ideal.tif, empty unless options.idealPixel > 0
    std::string notesPath;    // sample.json: what made the sample, each image's gain
    std::string masterPath;
    std::vector<SampleImage> images;
};

// Writes the DSM (dsm.tif, and dsm_true.tif when options.dsmError > 0), the images (<camera
// name>.tif) with their cameras (<camera name>.camera.json), cameras.txt, master.txt, ideal.tif
// when options.idealPixel > 0, and sample.json (the options that made the sample, each image's
// exposure gain, the ideal image's grid) into an existing directory. threads: rendering threads (0: the hardware's count).
Sample MakeSample(const std::string& directory, const CityOptions& options,
                  unsigned int threads = 0);

// Writes the DSM alone as a Float32 GeoTIFF.
void WriteDsm(const Dsm& dsm, const std::string& path);

// A raster surface model read whole into memory, bilinear between post centres; no height
// outside. For tests and examples until the platform's own DEMs are used.
class GridSurface : public kestrel::dem::IElevationSource {
  public:
    explicit GridSurface(const std::string& path);
    ~GridSurface() override;
    void SetOutputVerticalDatum(kestrel::ogc::cs::DatumType datum) override { datum_ = datum; }
    kestrel::ogc::cs::DatumType GetOutputVerticalDatum() const override { return datum_; }
    const kestrel::ogc::cs::ICRS* GetCRS() const override { return crs_.get(); }
    void GetExtent(double& minX, double& minY, double& maxX, double& maxY) const override;
    void SetInputCRS(const kestrel::ogc::cs::ICRS* crs) override;
    void GetHeights(std::size_t n, const double* x, const double* y,
                    double* heights) const override;

  private:
    std::unique_ptr<kestrel::ogc::cs::ICRS> crs_;
    std::unique_ptr<kestrel::ogc::cs::CoordinateTransformation> input_;
    kestrel::ogc::cs::GeocodingInfo geocoding_;
    unsigned int width_ = 0, height_ = 0;
    std::vector<float> posts_;
    kestrel::ogc::cs::DatumType datum_ = kestrel::ogc::cs::DatumEllipsoid;
};

// The RPC model of an image file: ground is geographic WGS 84 (longitude, latitude) with
// ellipsoidal heights. For tests and examples until the platform's own models are used.
class RpcModel : public kestrel::mathmodel::IMathModel {
  public:
    explicit RpcModel(const std::string& imagePath);
    ~RpcModel() override;
    const kestrel::ogc::cs::ICRS* GetCRS() const override { return crs_.get(); }
    unsigned int GetImageWidth() const override { return width_; }
    unsigned int GetImageHeight() const override { return height_; }
    void GroundToImage(std::size_t n, const double* x, const double* y, const double* z,
                       double* pixel, double* line, bool* ok) const override;
    // Newton iteration on the inverse at the given heights.
    void ImageToGround(std::size_t n, const double* pixel, const double* line, const double* z,
                       double* x, double* y, bool* ok) const override;
    const Rpc& Coefficients() const { return rpc_; }

  private:
    Rpc rpc_;
    unsigned int width_ = 0, height_ = 0;
    std::unique_ptr<kestrel::ogc::cs::ICRS> crs_;
};

}  // namespace samplecity
