// The steps of the workflow that do the photogrammetry, each a call chain into the library:
// layout, ortho and visibility index, footprint, occlusion recovery, quicklooks.
#pragma once

#include "options.h"

#include <kestrel/elevation.h>
#include <kestrel/gdalsupport.h>
#include <kestrel/mathmodel.h>
#include <silvan/polygon.h>
#include <silvan/toimgsetparser.h>

#include <gdal.h>

#include <array>
#include <functional>
#include <memory>
#include <string>
#include <vector>

class GDALDataset;
class OGRGeometry;
class OGRSpatialReference;

namespace ortho {

// Where a raster grid lies: its CRS as WKT, GDAL's geotransform, and its size.
struct Grid {
    std::string crs;
    std::array<double, 6> geoTransform{};
    unsigned int pixels = 0;
    unsigned int lines = 0;
    // Of a scene's own layout over a raster DSM: the share of the image's ground that the
    // surface does not cover (the layout is that of the covered ground).
    double uncoveredShare = 0.0;

    double PixelSize() const;
    // Same size, same placement (to a thousandth of a pixel), same CRS text.
    bool SameAs(const Grid& other) const;
    std::string Describe() const;
};

// One line of the preparation file, as a process reads it; the source path resolved.
struct SceneInput {
    std::string source;
    std::vector<unsigned int> channels;
    int mmseg = 0;
    std::vector<int> dbiw;
    std::string srcBgd;
    int edgeClip = 0;
};

using Footprint = std::unique_ptr<kestrel::tin::Polygon<double>>;
// Progress of one step: the fraction done. Returns false to stop.
using StepProgress = std::function<bool(double fraction)>;

// Checks every option value before any work: the surface model exists, the values the library
// interprets (-elevref, -elfactor, units, output CRS, PROC text, resampling method, file type)
// are accepted and the file type can be written. Throws UsageError naming the option. Puts the
// resampling method in the spelling --help lists. Returns lines worth telling the user, such as
// a generator that falls back to the central processor.
std::vector<std::string> CheckOptions(Options& options);

// The math model of a source: the camera of --cameras when given, else the source's own model
// of segment mmseg.
std::unique_ptr<kestrel::mathmodel::IMathModel> OpenModel(const Options& options,
                                                          const std::string& source, int mmseg);
std::unique_ptr<kestrel::mathmodel::IMathModel> OpenModel(const Options& options,
                                                          const SceneInput& scene);

// Checks what the surface model's file (and --dtm's) says of its heights (vertical datum and
// unit) against --elevref and --elunits, without reading the heights: a contradiction throws,
// naming the file and the option. Where the file says nothing, the options hold (MSL and metres
// by default). Throws UsageError; a file that cannot be read is left to OpenSurface.
void CheckSurface(const Options& options);

// Checks the options that hold for the sources' math models before any work: --elevref MATHMODEL
// over a surface whose file says its datum (every model must have that datum) and --cameras (it
// must orient at least one image). Opens every source's model only when one of them is given.
// Throws UsageError naming the option and the line.
void CheckModels(const Options& options);

// The surface model of the options (--dem or --tin) with the heights corrected and delivered in
// the datum of the math model (null: the ellipsoid), after CheckSurface's checks and, for
// --elevref MATHMODEL over a file that says its datum, the check that the model's datum is that
// one. The caller owns it.
std::unique_ptr<kestrel::dem::IElevationSource> OpenSurface(
    const Options& options, const kestrel::mathmodel::IMathModel* model);
// The ground heights of --dtm, opened and corrected as the surface model; null without --dtm.
std::unique_ptr<kestrel::dem::IElevationSource> OpenGround(
    const Options& options, const kestrel::mathmodel::IMathModel* model);

// One line for the log: how many posts of the raster surface model under the grid have no
// height, e.g. "--dem dsm.tif: 120 of 40000 posts under the output grid (0.30 %) have no
// height"; empty for a TIN.
std::string SurfaceHoles(const Options& options, const Grid& grid);

// The layout of a scene on its own: the grid in crs (empty: chosen for the scene) with the
// pixel width and height (0: the source's resolution), the scene's footprint when asked for, and
// the grid's uncoveredShare when asked for.
Grid SceneLayout(const Options& options, const SceneInput& scene, const std::string& crs,
                 double pixelWidth, double pixelHeight, Footprint* footprint,
                 bool uncoveredShare);

// A rectangle XMIN YMIN XMAX YMAX, as gdalwarp's -te.
using Area = std::array<double, 4>;

// The area of interest (--te) in crs: as given, or, with --te-srs, the bounding box of its
// densified edges transformed into crs. Throws when the transformation fails.
Area AreaInCrs(const Options& options, const std::string& crs);

// The ground that --te and --cutline keep, in one CRS.
class AreaOfInterest {
  public:
    // The --te rectangle (area) and the --cutline polygons in crs; both when both are given.
    // Throws when the cutline cannot be read or transformed.
    AreaOfInterest(const Options& options, const std::string& crs, const Area* area);
    ~AreaOfInterest();
    AreaOfInterest(const AreaOfInterest&) = delete;
    AreaOfInterest& operator=(const AreaOfInterest&) = delete;
    // Whether the footprint and the area share ground (more than an edge or a corner).
    bool Reaches(const kestrel::tin::Polygon<double>& footprint) const;

  private:
    std::unique_ptr<OGRGeometry> shape_;
};

// The common grid of the scenes' grids, all in the first one's CRS and pixel size. Without an
// area: the smallest grid that holds every grid, its corners whole multiples of the pixel size,
// in whole blocks of 16 pixels and lines. With one: exactly the area's cells as gdalwarp -te
// -tr makes them (top left at XMIN YMAX, sizes rounded to whole pixels).
Grid CommonGrid(const std::vector<Grid>& grids, const Area* area = nullptr);

// The window of a scene on the common grid: the cells under the part of the footprint inside
// the grid, grown outward to whole cells and by a margin of two cells, clipped to the grid. Same
// CRS, pixel size and lattice as the grid. False when the footprint covers no ground of the grid.
bool SceneWindow(const Grid& common, const kestrel::tin::Polygon<double>& footprint, Grid& window);

// Where window's top left cell lies in grid, in whole cells.
std::array<long long, 2> CellOffset(const Grid& grid, const Grid& window);

// The window of pixels x lines cells whose top left cell is (column, row) of grid.
Grid WindowAt(const Grid& grid, long long column, long long row, unsigned int pixels,
              unsigned int lines);

// How many whole cells of `size` an extent holds, rounded as gdalwarp -te -tr rounds them.
double WholeCells(double extent, double size);

// The grid of an existing raster; false when it cannot be opened as one.
bool ReadGrid(const std::string& path, Grid& grid);

// What the ortho step wrote besides the rasters.
struct OrthoResult {
    double orthoNoData = 0.0;
    double elevationNoData = -32768.0;
};

// The true ortho and the visibility index of a scene on the grid, written to the two paths.
OrthoResult MakeOrtho(const Options& options, const SceneInput& scene, const Grid& grid,
                      const std::string& ortho, const std::string& visibility,
                      const StepProgress& progress);

// A new GeoPackage at path holding the footprint layer of the scene.
void WriteFootprint(const std::string& path, const kestrel::tin::Polygon<double>& footprint);

// One scene of the image set, as occlusion recovery takes it.
struct RecoveryScene {
    std::string id;      // the image set's scene identifier
    std::string source;  // the source image and its math-model segment, for viewing angles
    int mmseg = 0;
    std::string ortho;
    std::string visibility;
    RadiometricDiff radioDif = RadioDifAny;
    int dbmPxErr = 0;
    std::string name;  // NAME of NAME_ortho.tif, as the seamline layer names the scene
    unsigned int masterLine = 0;
};

// The GDAL format of the mosaic: a Cloud Optimized GeoTIFF when --of is a GeoTIFF type, the
// format of --of otherwise.
std::string MosaicFormat(const Options& options);

// The --co options, in their order, that the per-scene orthos' driver (or the mosaic's) takes:
// those that make them.
std::vector<std::string> TakenCreationOptions(const Options& options, bool mosaic);

// The file type of the rasters of classes and scene numbers (the visibility index, the mosaic's
// source raster): --of, or tif where --of's driver is lossy, which would change their values.
std::string ClassRasterType(const std::string& type);

// Checks that --cutline opens as a vector file whose first layer holds polygons. Throws
// UsageError naming the option.
void CheckCutline(const std::string& path);

// The blend width of the mosaic: --blend-width, else the recovery's default.
unsigned int BlendWidth(const Options& options);

// What the mosaic step did besides writing the rasters.
struct MosaicResult {
    // The colour balance applied, per scene (in the order given) and channel:
    // value * gain + offset.
    std::vector<std::vector<double>> gain, offset;
    // Scenes of the master file that --seamlines names but that are not mosaicked in this run
    // (failed, outside the area of interest, not in the image set): their polygons are left out.
    std::vector<std::string> seamlinesSkipped;
};

// GDAL's block cache held to `bytes` while the object lives, unless the user sets GDAL_CACHEMAX;
// the size before is restored after.
class BlockCache {
  public:
    explicit BlockCache(GIntBig bytes);
    ~BlockCache();
    BlockCache(const BlockCache&) = delete;
    BlockCache& operator=(const BlockCache&) = delete;

  private:
    GIntBig before_ = -1;  // -1: left as it was
};
// The run's: neighbouring tiles of a scene read its source image's blocks again.
constexpr GIntBig kRunCacheBytes = GIntBig{128} << 20;
// The mosaic's: each of its passes reads the scenes' blocks in the order of its tiles, so that
// only the blocks at the edges of a row of tiles are read again, while the cache would fill with
// every scene read (and its blocks, freed by other threads, scatter the heap). On a block of 64
// images 16 MB took the same processor time as 32 or 128 MB and 35 MB less memory than 32 MB;
// 8 MB began to cost time.
constexpr GIntBig kMosaicCacheBytes = GIntBig{16} << 20;

// Fills the hidden ground of each scene from the others into the mosaic on the common grid,
// and records in source which scene each mosaic pixel came from; with --cutline, pixels
// outside it are left empty; with --seamlines, the layer's regions (burnt onto the grid)
// choose each pixel's scene, others (the master file's other scenes) may be named in it.
// Cutline and regions are burnt into temporary rasters beside the mosaic, removed after.
MosaicResult RecoverMosaic(const Options& options, const std::vector<RecoveryScene>& scenes,
                           const std::vector<std::string>& others, const Grid& grid,
                           const std::string& mosaic, const std::string& source,
                           const StepProgress& progress);

// Copies each scene's footprint layer into one GeoPackage, one layer per scene named after it.
struct FootprintLayer {
    std::string name;    // layer name: the scene's name
    std::string path;    // the scene's footprint file
    std::string source;  // the source image, recorded in a field
};
void MergeFootprints(const std::vector<FootprintLayer>& layers, const Grid& grid,
                     const std::string& path);

// A PNG picture of a raster for people to look at: up to 1024 pixels on the long side the
// raster's size; above, the size of its largest overview of at most 2048, or without one the
// raster's shrunk to 2048.
enum class Quicklook { Image, Visibility, SourceIndex };
// Each quicklook has a world file beside it (NAME.pgw); an image's bands share one stretch.
void WriteQuicklook(const std::string& raster, const std::string& png, Quicklook kind);
// The colour of a value of the source raster in its quicklook, "#rrggbb".
std::string SourceColour(unsigned int value);

using kestrel::gdalsupport::ErrorCapture;

struct DatasetClose {
    void operator()(GDALDataset* dataset) const;
};
using DatasetPtr = std::unique_ptr<GDALDataset, DatasetClose>;

// Throws FileAccessException naming the path, what failed and GDAL's reason.
[[noreturn]] void FailFile(const std::string& path, const std::string& what,
                           const ErrorCapture& errors);
// A new, empty GeoPackage at path (an older file there removed).
DatasetPtr CreateVector(const std::string& path, const ErrorCapture& errors);
// The grid's CRS, axes in GIS order (easting, northing).
OGRSpatialReference GridSrs(const Grid& grid);
// A working one-band GeoTIFF on the grid, all 0 (tiled, sparse), for layers burnt in.
DatasetPtr CreateGridRaster(const Grid& grid, const std::string& path, const ErrorCapture& errors,
                            GDALDataType type = GDT_Byte);

// text with A-Z lower-cased, whatever the locale.
std::string Lower(std::string text);

}  // namespace ortho
