// The true-ortho generator library: generator objects and the factory that makes them.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include <kestrel/crs.h>
#include <kestrel/elevation.h>
#include <kestrel/export.h>
#include <kestrel/mathmodel.h>
#include <kestrel/rasterio.h>
#include <kestrel/resampler.h>

namespace kestrel {
namespace processes {

// The kind of generator asked for. The underlying type is fixed so that an out-of-range value
// can be held and refused.
enum GeneratorType : int {
    GENERATOR_TORTHO = 0,             // a TorthoGenerator
    GENERATOR_OCCLUSION_RECOVERY = 1  // an OcclusionRecovery
};

enum class ProcessorKind { Central, Graphics };

// What a generator was created with.
struct GeneratorSettings {
    ProcessorKind processor = ProcessorKind::Central;
    // Central-processor threads; 0 lets the generator choose.
    unsigned int threadCount = 0;
    // Graphics processors by number; empty when they were chosen by count.
    std::vector<int> devices;
    // Graphics processors to use when none are listed; 0 for every usable one.
    unsigned int deviceCount = 0;
    // Work streams per graphics processor; 0 lets the generator choose.
    unsigned int streamCount = 0;
};

// Progress in GDAL's style: the fraction done (0 to 1), a message (may be null) and the user
// data given with the function. Returning false cancels the run. Generators call it from one
// thread at a time, though not always from the thread that started the run.
typedef bool (*ProgressFunc)(double fraction, const char* message, void* userData);

// Values of the visibility index, a Byte raster on the ortho's grid.
enum VisibilityValue : unsigned char {
    VISIBILITY_OUTSIDE = 0,  // the ground point projects outside the image, or onto its no-data
    VISIBILITY_SEEN = 1,     // the sensor sees the ground point; the ortho holds its value
    VISIBILITY_HIDDEN = 2,   // higher surface stands between the ground point and the sensor
    VISIBILITY_NODATA = 255  // the surface model has no height there
};

// Every generator. Generators are made by TrueOrthoFactory and owned by the caller.
class KESTREL_API ITrueOrtho {
  public:
    virtual ~ITrueOrtho();
    ITrueOrtho(const ITrueOrtho&) = delete;
    ITrueOrtho& operator=(const ITrueOrtho&) = delete;

    virtual GeneratorType GetGeneratorType() const = 0;

    GeneratorSettings GetSettings() const { return settings_; }
    ProcessorKind GetProcessor() const { return settings_.processor; }
    unsigned int GetThreadCount() const { return settings_.threadCount; }
    std::vector<int> GetDevices() const { return settings_.devices; }
    unsigned int GetDeviceCount() const { return settings_.deviceCount; }
    unsigned int GetStreamCount() const { return settings_.streamCount; }

    // The process's cancel flag (TOPPFBase::GetCancelFlag), or null for none. The generator
    // reads it while it runs, several times within each tile; once it is set the run stops.
    void SetCancelFlag(const bool* cancel) { cancel_ = cancel; }
    void SetProgress(ProgressFunc progress, void* userData) {
        progress_ = progress, progressData_ = userData;
    }

  protected:
    explicit ITrueOrtho(GeneratorSettings settings);
    // The central-processor threads to use: the thread count, or the hardware's when it is 0.
    unsigned int ThreadsToUse() const;
    const bool* CancelFlag() const { return cancel_; }
    ProgressFunc Progress() const { return progress_; }
    void* ProgressData() const { return progressData_; }

  private:
    GeneratorSettings settings_;
    const bool* cancel_ = nullptr;
    ProgressFunc progress_ = nullptr;
    void* progressData_ = nullptr;
};

// What a true-ortho run works on. The generator keeps no pointer beyond the run.
struct KESTREL_API TorthoJob {
    // The source raster (any raster GDAL reads) and its channels, counted from 1; empty means
    // every channel. All channels must share one data type, which the ortho takes.
    std::string sourcePath;
    std::vector<unsigned int> channels;
    // When given, the source is read through this reader (its channels, its data type) instead
    // of sourcePath and channels. Not owned; the generator's threads read it under a lock.
    datasources::IRasterReader* source = nullptr;
    // The source's math model. Ground points reach it in its own CRS (x, y transformed from the
    // ortho's CRS); heights are passed as the surface gives them.
    const mathmodel::IMathModel* model = nullptr;
    // The surface model with raised objects (a DSM or a TIN). Its output vertical datum must be
    // the model's (GetModelDatum); the generator sets its input CRS to the ortho's CRS.
    dem::IElevationSource* surface = nullptr;
    // GDAL's names: "near", "bilinear", "cubic".
    std::string resampling = "bilinear";
    // When given, this resampler (ResamplerFactory: every GDAL method it knows) is used instead
    // of the method named by `resampling`. It is shared by the threads (const queries only).
    const utils::IRasterResampler* resampler = nullptr;
    // The ortho's grid.
    const ogc::cs::ICRS* crs = nullptr;
    ogc::cs::GeocodingInfo geocoding;
    unsigned int pixels = 0, lines = 0;
    // Outputs, written through the platform's BasicWriter under a temporary name beside the final
    // one and published when complete: tiled and compressed GeoTIFF by default; the visibility
    // index one Byte band in any format, its overviews (COG) the nearest class.
    std::string orthoPath, visibilityPath;
    std::string format = "GTiff";  // a GDAL raster driver that writes files, directly or by copy
    // When given (both or neither), the outputs go to these writers instead of orthoPath and
    // visibilityPath. Not owned. The generator describes and creates them and closes them only
    // when the run completes; after a cancelled or failed run the caller deletes them unclosed,
    // which leaves nothing under their final names.
    datasources::IRasterWriter* orthoWriter = nullptr;
    datasources::IRasterWriter* visibilityWriter = nullptr;
    // Value of ortho pixels that are not seen. The source's own no-data values are never used.
    double orthoNoData = 0.0;
    // Metres a ground point may lie below the surface that the sensor sees at its image position
    // and still count as seen: absorbs the surface's interpolation and rounding.
    double heightTolerance = 0.2;
    // Output pixels per tile side: memory grows with its square.
    unsigned int tileSize = 256;
    // Largest error, in image pixels, allowed to the interpolation of the grid-to-image
    // projection between exactly projected lattice points (as gdalwarp's -et); 0 projects every
    // pixel exactly. Heights are always the surface's own at each pixel. The default keeps
    // sharp-edged images within one grey level of the exact projection on 99.9 % of the pixels.
    double errorThreshold = 0.02;
};

// The output grid's pixel centres projected into the source image at their own heights, as the
// generators (and a graphics-processor generator deriving from them) need it: exact at the
// nodes of a lattice over a window and at a few heights, interpolated in between (bilinearly
// over the grid, by parabolas through three heights). The lattice is refined, halving its step or doubling its
// heights, until the interpolation error checked against the exact projection at cell centres,
// edge midpoints and mid-heights is at most maxError image pixels, as gdalwarp's approximate
// transformer does; maxError 0 projects every pixel exactly, and so does a window where the
// model has no answer at some node. One object per thread.
class KESTREL_API GridProjection {
  public:
    // toModel: from the grid's CRS to the model's x and y, or null when they are the same; not
    // owned, used by this object's thread only.
    GridProjection(const ogc::cs::GeocodingInfo& grid, const mathmodel::IMathModel& model,
                   const ogc::cs::CoordinateTransformation* toModel, double maxError);
    ~GridProjection();
    GridProjection(const GridProjection&) = delete;
    GridProjection& operator=(const GridProjection&) = delete;

    // Image positions of the pixel centres (x0 + i + 0.5, y0 + j + 0.5), i < width, j < height,
    // at the heights given for them (line after line); ok is false where the height is not
    // finite or the model has no answer.
    void Project(int x0, int y0, int width, int height, const double* heights, double* col,
                 double* row, bool* ok);
    // The lattice of the last Project: its step in grid pixels (0: every pixel exact) and the
    // number of heights.
    int LastStep() const;
    int LastLevels() const;

  private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

// Counts of the visibility index after a run.
struct TorthoResult {
    bool completed = false;  // false: cancelled, nothing left under the final names
    unsigned long long seen = 0, hidden = 0, outside = 0, noHeight = 0;
};

// The true-ortho generator. The central-processor work is here; a graphics-processor generator
// derives from it and overrides Generate, with the same job and the same outputs.
class KESTREL_API TorthoGenerator : public ITrueOrtho {
  public:
    explicit TorthoGenerator(GeneratorSettings settings = GeneratorSettings());
    ~TorthoGenerator() override;
    GeneratorType GetGeneratorType() const override { return GENERATOR_TORTHO; }

    // Writes the ortho and its visibility index. Throws DataException for bad input (saying
    // what and where) and FileAccessException for outputs that cannot be written; in both
    // cases, and when cancelled, nothing is left under the outputs' final names.
    virtual TorthoResult Generate(const TorthoJob& job);
};

// The creation options of a per-scene raster of GDAL's `format`, over the writer's defaults:
// for GeoTIFF the fastest deflate level (recovery decodes each scene pixel several times, and
// the default level costs a quarter of a run's processor time in encoding); for the ortho,
// blocks of 128 (recovery's windows lie anywhere on a scene's blocks: those of 256 made it
// decode about half as much again); for a raster of classes (the visibility index) no
// predictor, which undoing costs about five times the inflating of those runs of equal
// classes, and overviews (COG) that take the nearest class. The visibility index keeps blocks
// of 256: its blocks inflate so fast that the cost per block outweighs the bytes saved.
KESTREL_API std::string SceneRasterOptions(const std::string& format, bool classes);

// The radiometric difference level of a scene (as RadiometricDiff: 0 ANY, 1 LOW, 2 MODERATE,
// 3 HIGH): a scene of a higher level is a later choice for filling.
struct KESTREL_API RecoveryScene {
    std::string orthoPath, visibilityPath;
    int radiometricLevel = 0;
    // The surface model's pixel error in ortho pixels: a seen pixel closer than this to a
    // hidden one is trusted only when no other image sees the pixel clearly.
    int dbmPixelError = 0;
    // The scene's math model, for its viewing angle at each pixel; null: angle unknown, the
    // scene comes after those whose angle is known.
    const mathmodel::IMathModel* model = nullptr;
};

struct KESTREL_API RecoveryJob {
    // Orthos on windows of one grid: one CRS and pixel size, origins a whole number of pixels
    // apart.
    std::vector<RecoveryScene> scenes;
    // The mosaic's grid on the same lattice; pixels 0: the smallest grid holding every scene.
    ogc::cs::GeocodingInfo geocoding;
    unsigned int pixels = 0, lines = 0;
    // Heights for the viewing angles (may be null: angles unknown), in the models' datum.
    dem::IElevationSource* surface = nullptr;
    std::string mosaicPath, sourcePath;  // the mosaic and the raster of source scenes
    // A GDAL driver. A COG mosaic marks the pixels no scene fills in a mask, not by a colour;
    // the source raster's overviews take the nearest value.
    std::string format = "GTiff";
    std::string mosaicOptions;  // the mosaic's creation options (BasicWriter's `options`)
    unsigned int tileSize = 256;
    // A raster on the common grid (a cutline burnt in): where its first band holds 0 no scene
    // fills the mosaic. Empty: none.
    std::string maskPath;

    // The regions: a raster on the mosaic grid giving each pixel's scene (1 + its index in
    // `scenes`, 0 none), edited seamlines burnt in, say. Empty: chosen by seamlines that avoid
    // raised objects. Where a region's scene does not see the ground the best other scene fills.
    std::string regionsPath;
    // False: no seamlines; each pixel takes the scene that ranks first there (clear view, lower
    // radiometric level, steeper line of sight, listed first), as before seamlines.
    bool seamlines = true;
    // Ground heights without raised objects (a DTM), in the surface's datum, for the seam cost;
    // null: estimated from the surface.
    dem::IElevationSource* ground = nullptr;
    // Across each seam the two scenes are blended over this many mosaic pixels; 0: hard seams.
    unsigned int blendWidth = 16;
    static constexpr unsigned int kMaxBlendWidth = 4096;
    enum class Blend { Feather, Multiband };
    Blend blend = Blend::Feather;
    // Per scene and channel a gain (and offset) that makes overlapping scenes agree.
    enum class Balance { None, Gain, GainOffset };
    Balance balance = Balance::GainOffset;
};

struct TorthoRecoveryResult {
    bool completed = false;
    unsigned long long filled = 0;    // pixels that came from a scene
    unsigned long long unfilled = 0;  // pixels that no scene sees
    // Scene tiles the composition read: per tile of the mosaic, the scenes meeting it (with a
    // regions raster, only those it names, and the others where a pixel that no named scene
    // sees lies on their rasters).
    unsigned long long sceneReads = 0;
    // The balance applied, per scene and channel: value * gain + offset.
    std::vector<std::vector<double>> gain, offset;
};

// Occlusion recovery: the true-ortho mosaic of several orthos of one image set.
class KESTREL_API OcclusionRecovery : public ITrueOrtho {
  public:
    explicit OcclusionRecovery(GeneratorSettings settings = GeneratorSettings());
    ~OcclusionRecovery() override;
    GeneratorType GetGeneratorType() const override { return GENERATOR_OCCLUSION_RECOVERY; }

    // Writes the mosaic (the orthos' data type and no-data value) and the source raster (Byte,
    // 1 + the scene's index in the job, 0 where no scene sees the pixel). Failures and
    // cancellation as for TorthoGenerator::Generate.
    virtual TorthoRecoveryResult Recover(const RecoveryJob& job);
};

// The four ways of making a generator. Each returns a new object owned by the caller, or null
// when it cannot make one; each throws DataException for a GeneratorType other than 0 and 1.
class KESTREL_API TrueOrthoFactoryImpl {
  public:
    virtual ~TrueOrthoFactoryImpl();

    // A generator on the best processor present: a usable graphics processor, otherwise the
    // central processor with threadCount threads.
    virtual ITrueOrtho* CreateGenerator(GeneratorType type, unsigned int threadCount) = 0;
    virtual ITrueOrtho* CreateCPUGenerator(GeneratorType type, unsigned int threadCount) = 0;
    // On the listed graphics processors.
    virtual ITrueOrtho* CreateCudaGenerator(GeneratorType type, const std::vector<int>& devices,
                                            unsigned int threadCount, unsigned int streamCount) = 0;
    // On deviceCount usable graphics processors (0: every usable one).
    virtual ITrueOrtho* CreateCudaGenerator(GeneratorType type, unsigned int threadCount,
                                            unsigned int deviceCount, unsigned int streamCount) = 0;

  protected:
    TrueOrthoFactoryImpl() = default;
    TrueOrthoFactoryImpl(const TrueOrthoFactoryImpl&) = default;
    TrueOrthoFactoryImpl& operator=(const TrueOrthoFactoryImpl&) = default;
};

// The factory the processes call. Its calls go to the installed implementation, which is the
// built-in one unless a test has installed another.
//
// The built-in implementation has no graphics-processor support: it finds no usable graphics
// processor, so the graphics-processor calls return null and CreateGenerator makes a
// central-processor generator.
class KESTREL_API TrueOrthoFactory {
  public:
    static ITrueOrtho* CreateGenerator(GeneratorType type, unsigned int threadCount);
    static ITrueOrtho* CreateCPUGenerator(GeneratorType type, unsigned int threadCount);
    static ITrueOrtho* CreateCudaGenerator(GeneratorType type, const std::vector<int>& devices,
                                           unsigned int threadCount, unsigned int streamCount);
    static ITrueOrtho* CreateCudaGenerator(GeneratorType type, unsigned int threadCount,
                                           unsigned int deviceCount, unsigned int streamCount);

    // The built-in implementation, for an installed one that passes some calls on.
    static std::shared_ptr<TrueOrthoFactoryImpl> GetDefaultImplementation();
    // Installs impl (null restores the built-in one) and returns the one it replaces. Not meant
    // to be called while another thread creates a generator.
    static std::shared_ptr<TrueOrthoFactoryImpl> SetImplementation(
        std::shared_ptr<TrueOrthoFactoryImpl> impl);
};

// Installs a factory implementation for its own lifetime and restores the previous one after.
class KESTREL_API ScopedTrueOrthoFactoryImpl {
  public:
    explicit ScopedTrueOrthoFactoryImpl(std::shared_ptr<TrueOrthoFactoryImpl> impl);
    ~ScopedTrueOrthoFactoryImpl();
    ScopedTrueOrthoFactoryImpl(const ScopedTrueOrthoFactoryImpl&) = delete;
    ScopedTrueOrthoFactoryImpl& operator=(const ScopedTrueOrthoFactoryImpl&) = delete;

  private:
    std::shared_ptr<TrueOrthoFactoryImpl> previous_;
};

}  // namespace processes
}  // namespace kestrel
