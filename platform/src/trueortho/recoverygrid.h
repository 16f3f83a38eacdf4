// Occlusion recovery's inputs: the scenes' orthos and visibility indexes on windows of the
// mosaic grid, a spatial index of those windows, and one scene read over a rectangle of the grid.
#pragma once

#include <kestrel/trueortho.h>

#include "balance.h"
#include "rasterfiles.h"
#include "seams.h"

#include <gdal.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <list>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace kestrel {
namespace processes {
namespace trueortho {

// A rectangle of the mosaic grid, in pixels; it may reach outside the grid.
struct Rect {
    int x = 0, y = 0, width = 0, height = 0;
    std::size_t Size() const { return static_cast<std::size_t>(width) * height; }
    bool Empty() const { return width <= 0 || height <= 0; }
    Rect Intersect(const Rect& o) const;
    // The bounding box of both (an empty one adds nothing).
    Rect Union(const Rect& o) const;
    Rect Grown(int border) const {
        return {x - border, y - border, width + 2 * border, height + 2 * border};
    }
};

class RasterPool;

// A raster of the run, shared by the threads: opened when read, and closed again by its pool
// when too many are open. GDAL datasets serve one thread at a time, hence the lock.
struct SharedRaster {
    std::string path;
    const char* role = "raster";
    Rect window;  // where it lies on the mosaic grid
    RasterPool* pool = nullptr;  // null: stays open
    std::mutex mutex;
    DatasetPtr dataset;  // while open
    GDALDataType type = GDT_Float32;  // of its first band (an ortho's: Byte if all are)
    // Reads `count` bands over `r` (mosaic pixels) as `bufferType` into buffer (r.width x
    // r.height per band); parts outside the raster keep what the buffer holds.
    void Read(const int* bands, int count, const Rect& r, GDALDataType bufferType, void* buffer);
    // The first band as Float32.
    void Read(const Rect& r, float* buffer) { Read(&kFirstBand, 1, r, GDT_Float32, buffer); }
    static constexpr int kFirstBand = 1;

  private:
    friend class RasterPool;
    bool listed_ = false;
    std::list<SharedRaster*>::iterator place_;
};

// Keeps at most about `capacity` rasters open, closing the least recently read one that no
// thread is reading, so that open files and their memory do not grow with the number of
// scenes.
class RasterPool {
  public:
    explicit RasterPool(std::size_t capacity) : capacity_(capacity) {}
    // Marks `raster` (whose lock the caller holds) as just read.
    void Touch(SharedRaster& raster);
    // Closes every raster, with the blocks GDAL holds for them; no thread may be reading.
    void CloseAll();

  private:
    std::mutex mutex_;
    std::list<SharedRaster*> order_;  // most recently read first
    std::size_t capacity_;
};

struct RecoveryGrid {
    unsigned int pixels = 0, lines = 0;
    int bands = 0;
    GDALDataType type = GDT_Unknown;
    std::array<double, 6> geoTransform{};
    std::unique_ptr<ogc::cs::ICRS> crs;
    bool hasNoData = false;
    double noData = 0;  // the first scene's
    int halo = 0;       // the largest pixel error
    // Rasters open at once. GDAL holds some 300 kB for each (a tile of all its bands, the
    // file's buffers): 128 held 40 MB on a block of 64 scenes. A tile reads up to about a dozen
    // scenes (two rasters each) where the overlap is deepest; a raster closed too early is
    // opened again, which cost no measurable time on that block.
    static constexpr std::size_t kOpenRasters = 32;
    std::unique_ptr<RasterPool> pool = std::make_unique<RasterPool>(kOpenRasters);
    std::vector<std::unique_ptr<SharedRaster>> orthos, visibilities;
    // The scenes' windows clipped to the grid (empty when a scene lies outside it).
    std::vector<Rect> windows;

    Rect Whole() const { return {0, 0, static_cast<int>(pixels), static_cast<int>(lines)}; }
    // The grid cut into squares of `side` pixels (narrower at the right and bottom), line after
    // line: how many, and the one at `index`.
    std::size_t TileCount(int side) const {
        return static_cast<std::size_t>((pixels + side - 1) / side) * ((lines + side - 1) / side);
    }
    Rect Tile(int side, std::size_t index) const {
        const unsigned int across = (pixels + side - 1) / side;
        return Rect{static_cast<int>(index % across) * side,
                    static_cast<int>(index / across) * side, side, side}
            .Intersect(Whole());
    }
    // The index of the tile to take `q`-th: tiles in bands of kBandRows lines of tiles, column
    // after column within a band. A scene's blocks straddle tile edges; taken line after line,
    // a whole line of tiles came between a block's reads, and GDAL's block cache had let it go.
    static constexpr std::size_t kBandRows = 4;
    std::size_t InBands(int side, std::size_t q) const {
        const std::size_t across = (pixels + side - 1) / side, down = (lines + side - 1) / side;
        const std::size_t first = q / (across * kBandRows) * kBandRows;
        const std::size_t rows = std::min(kBandRows, down - first), within = q - first * across;
        return (first + within % rows) * across + within / rows;
    }
    // The scenes whose window meets r, in the job's order.
    std::vector<std::size_t> ScenesMeeting(const Rect& r) const;
    // Opens a raster that must lie on the grid's lattice (a mask, the regions); throws naming it.
    std::unique_ptr<SharedRaster> OpenOnGrid(const std::string& path, const char* role) const;

    // The spatial index: square buckets of kBucket pixels, each listing the scenes whose window
    // meets it. A query visits the buckets under its rectangle, so its cost grows with the
    // rectangle's area times the overlap, not with the number of scenes.
    static constexpr int kBucket = 256;
    int bucketsX = 0, bucketsY = 0;
    std::vector<std::vector<std::uint32_t>> buckets;
};

// Opens every scene for the whole run, checks that they lie on one lattice with one channel
// count and data type, and lays out the mosaic grid (the job's, or the union of the windows).
KESTREL_API RecoveryGrid InspectScenes(const RecoveryJob& job);

// Values as the mosaic's data type holds them: rounded and clamped for integer types.
class ValueRange {
  public:
    explicit ValueRange(GDALDataType type = GDT_Float32);
    float operator()(double v) const {
        if (integer_)
            v = Round(v);
        return static_cast<float>(std::min(hi_, std::max(lo_, v)));
    }
    // A value that is not `noData`, the nearest one inside the range when it is.
    float Besides(float v, double noData) const {
        return v != static_cast<float>(noData) ? v : Beside(noData);
    }
    // The 256 values of a Byte band balanced (value * gain + offset, as the range holds it), or
    // the values themselves when gain is 1 and offset 0.
    void BalancedBytes(double gain, double offset, float table[256]) const {
        const bool balanced = !(gain == 1 && offset == 0);
        for (int v = 0; v < 256; ++v)
            table[v] = balanced ? (*this)(gain * v + offset) : static_cast<float>(v);
    }
    // True for a value at either end of an integer type's range: a clipped (saturated) value
    // says nothing of the scene's exposure.
    bool Clipped(float v) const { return integer_ && (v <= lo_ || v >= hi_); }

  private:
    // std::round (halves away from zero) without the library call: below 2^52 the fraction
    // v - trunc(v) is exact.
    static double Round(double v) {
        if (!(std::fabs(v) < 4503599627370496.0))
            return std::round(v);  // whole already, or NaN
        const double whole = static_cast<double>(static_cast<long long>(v));
        return std::fabs(v - whole) >= 0.5 ? whole + (v < 0 ? -1.0 : 1.0) : whole;
    }
    float Beside(double noData) const;

    bool integer_;
    double lo_, hi_;
};

// One scene over a rectangle of the mosaic grid.
struct SceneTile {
    std::size_t scene = 0;
    // Per pixel: kNotSeen, kClear (seen, no hidden pixel within the pixel error) or kUnclear.
    std::vector<unsigned char> state;
    std::vector<float> angle;   // tangent of the off-nadir angle (infinity: unknown), if asked
    std::vector<float> values;  // `bands` planes, if asked
};
enum : unsigned char { kNotSeen = 0, kClear = 1, kUnclear = 2 };

constexpr float kUnknownAngle = std::numeric_limits<float>::infinity();
// Angles are computed on a lattice of nodes kAngleStep pixels apart (and on a rectangle's last
// pixel) and interpolated within its cells: they change slowly. Cells of a rectangle `size`
// pixels across: AngleCells(size).
constexpr int kAngleStep = 16;
inline int AngleCells(int size) { return (size + kAngleStep - 1) / kAngleStep; }

// Reads scenes over rectangles; Read may be called from several threads, each with its own
// Scratch.
class KESTREL_API SceneReader {
  public:
    struct Scratch {
        // The visibility index over the read with its border: VISIBILITY_SEEN, VISIBILITY_HIDDEN
        // or another value (a raster of another type than Byte is read into `values` first).
        std::vector<unsigned char> visibility;
        std::vector<float> values;
        std::vector<unsigned char> row;  // PixelStates'
        std::vector<unsigned char> bytes;  // a Byte ortho's values
        std::vector<int> last;
        std::vector<unsigned char> cells;  // Read's: the angle cells the scene sees
        std::vector<std::unique_ptr<ogc::cs::CoordinateTransformation>> toModel;
    };
    SceneReader(const RecoveryJob& job, const RecoveryGrid& grid);
    // Fills `out` for scene s over r, the angles only in the lattice cells where the scene sees
    // some pixel; false (values and angles not read) when it sees no pixel of r.
    bool Read(std::size_t s, const Rect& r, bool values, bool angles, Scratch& scratch,
              SceneTile& out) const;
    // The visibility index of scene s over r with a border of its DBM pixel error, as
    // VISIBILITY_SEEN, VISIBILITY_HIDDEN or VISIBILITY_OUTSIDE (the index's other values);
    // false when the scene sees no pixel of r.
    bool ReadVisibility(std::size_t s, const Rect& r, Scratch& scratch,
                        std::vector<unsigned char>& vis) const;
    // The ortho's `bands` planes over r as they are, when its raster is Byte (else false and
    // nothing read); parts outside the raster hold anything.
    bool ReadBytes(std::size_t s, const Rect& r, std::vector<unsigned char>& bytes) const;
    // The angles of out.scene over r, for a tile Read without them: in the cells of the angle
    // lattice that `cells` flags (AngleCells(r.width) per row, line after line), or all of r
    // when it is null; unknown elsewhere.
    void ReadAngles(const Rect& r, Scratch& scratch, SceneTile& out,
                    const std::vector<unsigned char>* cells = nullptr) const;
    // The ortho's `bands` planes over r; no-data outside the scene's raster.
    void ReadValues(std::size_t s, const Rect& r, std::vector<float>& values) const;
    // The same, balanced (value * gain + offset per band, as `range` holds it) where `state`
    // (over r) says the scene sees the pixel; `values` holds planes over r, but is read only
    // over `part` of r (the rest may hold anything).
    void ReadBalanced(std::size_t s, const Rect& r, const Rect& part,
                      const std::vector<double>& gain,
                      const std::vector<double>& offset, const std::vector<unsigned char>& state,
                      const ValueRange& range, Scratch& scratch, std::vector<float>& values) const;

  private:
    const RecoveryJob& job_;
    const RecoveryGrid& grid_;
    std::vector<int> bands_;  // 1 to the grid's band count
    std::vector<std::unique_ptr<ogc::cs::CoordinateTransformation>> toModel_;
};

// The state of each pixel of a w x h rectangle: kNotSeen, kClear or kUnclear (a
// VISIBILITY_HIDDEN pixel within e pixels, a square neighbourhood); `vis` is the rectangle with
// a border of e pixels.
void PixelStates(const unsigned char* vis, int w, int h, int e, SceneReader::Scratch& scratch,
                 std::vector<unsigned char>& state);

// Whether pixel (i, j) of a rectangle is kClear as PixelStates has it; `vis` is the rectangle
// with a border of e pixels, `width` pixels across with it.
bool SeenClearly(const unsigned char* vis, int width, int e, int i, int j);

// Metres per pixel of the grid (near enough on a geographic one).
double PixelMetres(const RecoveryGrid& grid);

// Per pair of scenes whose windows meet, the pixels both see clearly, decimated on a lattice so
// that a pair gives at most about kPairSamples, and all pairs together about kTotalSamples
// (but a pair at least kFewestSamples), so that the samples' memory stays within some 6 MB up
// to some 250 pairs (about 64 scenes of an aerial block) and then grows by 24 kB a pair.
constexpr double kPairSamples = 20000, kTotalSamples = 2.5e5, kFewestSamples = 1000;
std::vector<OverlapSamples> GatherOverlaps(const RecoveryJob& job, const RecoveryGrid& grid,
                                           const SceneReader& reader, unsigned int threads,
                                           RunControl& control);

// The seam solver's view of the scenes (costs, balanced brightness, raised heights). Once
// control stops, a read gives up at its next slice of heights or scene chunk and hands back a
// window without scenes: the run is being abandoned.
KESTREL_API std::unique_ptr<SeamSource> MakeSeamSource(const RecoveryJob& job,
                                                       const RecoveryGrid& grid,
                                                       const SceneReader& reader,
                                                       const BalanceFit& fit,
                                                       const RunControl& control);

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
