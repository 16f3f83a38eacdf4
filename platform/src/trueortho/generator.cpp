// The central-processor true-ortho generator: tile by tile, the surface under each output pixel
// is projected into the image, a z-buffer of the surface in image space tells seen from hidden,
// and seen pixels take the resampled image value.
#include <kestrel/exception.h>
#include <kestrel/raster.h>
#include <kestrel/trueortho.h>

#include <kestrel/gdalsupport.h>
#include "kernels.h"
#include "rasterfiles.h"
#include "runcontrol.h"
#include "zbuffer.h"

#include <gdal_priv.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstring>
#include <limits>
#include <mutex>

namespace kestrel {
namespace processes {

using trueortho::DatasetPtr;
using trueortho::Kernel;
using trueortho::RunControl;

namespace {

struct Plan;
struct Worker;

// How far, in output pixels, the surface that can hide a tile's ground reaches beyond the tile
// on each side: the line of sight's ground displacement per metre of height, largest over the
// points added, times the height range between the tile's lowest ground and the highest surface
// within that reach.
struct Extension {
    double left = 0, right = 0, up = 0, down = 0;
    bool any = false;
    // The line of sight at grid position (p, l); inImage tells whether the point is seen in the
    // image's frame at all.
    void Add(const Plan& plan, Worker& w, double p, double l, bool* inImage = nullptr);
    // Pixels on each side for a height range in metres.
    void Apply(const Plan& plan, double heightRange, int& extendLeft, int& extendRight,
               int& extendUp, int& extendDown) const;
};

// The lowest and highest surface in blocks of the output grid, from the survey's sample: a
// tile's first estimate of its height range.
struct HeightBlocks {
    static constexpr int kSize = 32;  // output pixels per block side
    int columns = 0, rows = 0;
    std::vector<float> low, high;  // +inf / -inf where the sample found no height
    // The range over the blocks that meet pixels [x0, x1) x [y0, y1), clipped to the grid; false
    // where none has a height.
    bool Range(int x0, int y0, int x1, int y1, double& lowest, double& highest) const {
        const int i0 = std::max(x0, 0) / kSize, j0 = std::max(y0, 0) / kSize;
        const int i1 = std::min((std::max(x1, 1) - 1) / kSize, columns - 1);
        const int j1 = std::min((std::max(y1, 1) - 1) / kSize, rows - 1);
        lowest = std::numeric_limits<double>::infinity(), highest = -lowest;
        for (int j = j0; j <= j1; ++j)
            for (int i = i0; i <= i1; ++i) {
                const size_t k = static_cast<size_t>(j) * columns + i;
                lowest = std::min(lowest, static_cast<double>(low[k]));
                highest = std::max(highest, static_cast<double>(high[k]));
            }
        return lowest <= highest;
    }
};

// The output grid and everything each tile needs from it, fixed before the tiles run.
struct Plan {
    const TorthoJob* job;
    Kernel kernel;
    std::vector<int> bands;
    int imageWidth, imageHeight;
    std::string sourceName;  // for messages
    GDALDataType dataType = GDT_Unknown;
    // The job's reader and the lock its reads share; without one each thread opens the file.
    datasources::IRasterReader* reader = nullptr;
    std::mutex* readLock = nullptr;
    std::vector<char> hasNoData;
    std::vector<float> noData;
    // What sizes each tile's extension, so that every surface that can stand between the
    // tile's ground and the sensor is projected.
    HeightBlocks blocks;
    Extension global;  // for tiles whose corners have no line of sight
    const ogc::cs::CoordinateTransformation* toModel = nullptr;  // null: same CRS
};

// Reads a window of the source as Float32, band after band, like trueortho::ReadWindow: parts
// outside the image are left as they are in the buffer.
void ReadSource(const Plan& plan, GDALDataset* dataset, int x, int y, int width, int height,
                float* buffer) {
    if (plan.reader == nullptr) {
        trueortho::ReadWindow(*dataset, plan.sourceName, plan.bands, x, y, width, height, buffer);
        return;
    }
    const int x0 = std::max(x, 0), y0 = std::max(y, 0);
    const int x1 = std::min(x + width, plan.imageWidth);
    const int y1 = std::min(y + height, plan.imageHeight);
    if (x1 <= x0 || y1 <= y0)
        return;
    std::unique_ptr<gobs::Raster> raster;
    {
        std::lock_guard<std::mutex> lock(*plan.readLock);
        raster.reset(plan.reader->ReadWindow(
            static_cast<unsigned int>(x0), static_cast<unsigned int>(y0),
            static_cast<unsigned int>(x1 - x0), static_cast<unsigned int>(y1 - y0)));
    }
    const GDALDataType type = static_cast<GDALDataType>(raster->GetDataType());
    const int size = static_cast<int>(raster->GetValueSize());
    for (size_t b = 0; b < plan.bands.size(); ++b) {
        const auto* plane =
            static_cast<const unsigned char*>(raster->GetChannelData(static_cast<unsigned int>(b)));
        for (int j = y0; j < y1; ++j)
            GDALCopyWords64(plane + static_cast<size_t>(j - y0) * (x1 - x0) * size, type, size,
                            buffer + (b * height + (j - y)) * static_cast<size_t>(width) + (x0 - x),
                            GDT_Float32, sizeof(float), x1 - x0);
    }
}

// A writer of the generator's own for an output given by path.
std::unique_ptr<datasources::BasicWriter> OutputWriter(const TorthoJob& job,
                                                       const std::string& path, size_t bands,
                                                       bool classes) {
    if (job.orthoWriter != nullptr)
        return nullptr;
    std::vector<unsigned int> channels(bands);
    for (size_t b = 0; b < bands; ++b)
        channels[b] = static_cast<unsigned int>(b + 1);
    return std::make_unique<datasources::BasicWriter>(path, channels, job.format,
                                                      SceneRasterOptions(job.format, classes));
}

// An output of the run, through a writer of the caller's or of the generator's own.
class TileOutput {
  public:
    TileOutput(const TorthoJob& job, datasources::IRasterWriter& writer, int bands,
               GDALDataType type, double noData)
        : writer_(writer), bands_(static_cast<unsigned int>(bands)) {
        writer_.SetSize(job.pixels, job.lines);
        writer_.SetDataType(static_cast<datasources::DataType>(type));
        writer_.SetChannelCount(bands_);
        writer_.SetCRS(job.crs);
        writer_.SetGeocoding(job.geocoding);
        writer_.SetNoDataValue(noData);
        writer_.Create();
    }

    // Writes a window of every band from a Float32 buffer (band after band); thread-safe.
    void Write(int x, int y, int width, int height, const float* buffer) {
        gobs::Raster raster(static_cast<unsigned int>(width), static_cast<unsigned int>(height),
                            bands_, datasources::DataType::Float32, gobs::Raster::Initial::Unset);
        std::memcpy(raster.GetData(), buffer, raster.GetByteSize());
        std::lock_guard<std::mutex> lock(mutex_);
        writer_.WriteWindow(raster, static_cast<unsigned int>(x), static_cast<unsigned int>(y));
    }

    void Commit() { writer_.Close(); }

  private:
    datasources::IRasterWriter& writer_;
    unsigned int bands_;
    std::mutex mutex_;
};

// Per-thread state: a source dataset of its own (GDAL datasets are not shared between
// threads), a transformation of its own (PROJ objects neither) and the tile buffers.
struct Worker {
    DatasetPtr source;
    std::unique_ptr<ogc::cs::CoordinateTransformation> toModel;
    std::unique_ptr<GridProjection> projection;
    std::vector<double> x, y, h, mx, my, col, row;
    std::unique_ptr<bool[]> ok;
    size_t okSize = 0;
    trueortho::ZBuffer zbuffer;
    trueortho::SourceWindow window;
    std::vector<float> ortho, visibility;
    // Seen pixels waiting for a given resampler: tile offset and image position.
    std::vector<size_t> pending;
    std::vector<double> pendingCol, pendingRow, resampled;
};

void Extension::Add(const Plan& plan, Worker& w, double p, double l, bool* inImage) {
    const TorthoJob& job = *plan.job;
    // Ground at p, at p + 1 pixel and at l + 1 line, projected at two heights.
    const double px[4] = {p, p + 1, p, p}, py[4] = {l, l, l + 1, l};
    double gx[4], gy[4], gz[4], c[4], r[4];
    bool ok[4];
    for (int k = 0; k < 4; ++k)
        job.geocoding.PixelToGround(px[k], py[k], gx[k], gy[k]);
    double h;
    if (!job.surface->GetHeight(gx[0], gy[0], h) || !std::isfinite(h))
        return;
    for (int k = 0; k < 4; ++k)
        gz[k] = k == 3 ? h + 1 : h;
    if (w.toModel)
        w.toModel->Transform(4, gx, gy);
    job.model->GroundToImage(4, gx, gy, gz, c, r, ok);
    if (!(ok[0] && ok[1] && ok[2] && ok[3]))
        return;
    if (inImage != nullptr)
        *inImage = c[0] >= 0 && r[0] >= 0 && c[0] < plan.imageWidth && r[0] < plan.imageHeight;
    // Image shift of one metre of height, expressed as ground pixels: J^-1 (d image).
    const double j00 = c[1] - c[0], j01 = c[2] - c[0], j10 = r[1] - r[0], j11 = r[2] - r[0];
    const double det = j00 * j11 - j01 * j10;
    if (!(std::fabs(det) > 1e-12))
        return;
    const double dc = c[3] - c[0], dr = r[3] - r[0];
    // Occluders of a point stand towards the sensor: against the image shift.
    const double dp = -(j11 * dc - j01 * dr) / det, dl = -(-j10 * dc + j00 * dr) / det;
    right = std::max(right, dp), left = std::max(left, -dp);
    down = std::max(down, dl), up = std::max(up, -dl);
    any = true;
}

void Extension::Apply(const Plan& plan, double heightRange, int& extendLeft, int& extendRight,
                      int& extendUp, int& extendDown) const {
    const Extension& e = any ? *this : plan.global;
    // A tenth more and two pixels: the line of sight bends a little between the points.
    auto pixels = [&](double perMetre) {
        return static_cast<int>(std::min(std::ceil(1.1 * perMetre * heightRange) + 2, 1e5));
    };
    extendLeft = pixels(e.left), extendRight = pixels(e.right);
    extendUp = pixels(e.up), extendDown = pixels(e.down);
}

// Surface heights at the output pixel centres of a window of the grid; a height that is not
// finite is no height.
void WindowHeights(const Plan& plan, Worker& w, int x0, int y0, int width, int height) {
    const TorthoJob& job = *plan.job;
    const size_t n = static_cast<size_t>(width) * height;
    w.x.resize(n), w.y.resize(n), w.h.resize(n);
    for (int j = 0; j < height; ++j)
        for (int i = 0; i < width; ++i) {
            const size_t k = static_cast<size_t>(j) * width + i;
            job.geocoding.PixelToGround(x0 + i + 0.5, y0 + j + 0.5, w.x[k], w.y[k]);
        }
    job.surface->GetHeights(n, w.x.data(), w.y.data(), w.h.data());
    for (double& v : w.h)
        if (!std::isfinite(v))
            v = std::numeric_limits<double>::quiet_NaN();
}

// The tile's window: the tile extended towards the sensor by as far as the highest surface
// within reach throws its view-shadow over the tile's lowest ground. Starts from the survey's
// blocks and grows while the heights found in the window reach further; leaves the window's
// heights in w.h.
void TileWindow(const Plan& plan, Worker& w, int tx, int ty, int tw, int th, int& ex, int& ey,
                int& ew, int& eh) {
    Extension reach;
    for (const double p : {0.0, tw / 2.0, static_cast<double>(tw)})
        for (const double l : {0.0, th / 2.0, static_cast<double>(th)})
            reach.Add(plan, w, tx + p, ty + l);
    double lowest, highest;
    if (!plan.blocks.Range(tx, ty, tx + tw, ty + th, lowest, highest))
        lowest = highest = 0;
    int left = 0, right = 0, up = 0, down = 0;
    // Blocks first: the reach of the blocks' heights until it no longer grows.
    for (int round = 0; round < 8; ++round) {
        reach.Apply(plan, highest - lowest + 1, left, right, up, down);
        double low, high;
        if (!plan.blocks.Range(tx - left, ty - up, tx + tw + right, ty + th + down, low, high) ||
            high <= highest)
            break;
        highest = high;
    }
    // Then the window's own heights (a few rounds at most: only a surface whose heights keep
    // rising ever farther out needs more, and gets the reach of the last round).
    for (int round = 0;; ++round) {
        ex = tx - left, ey = ty - up, ew = tw + left + right, eh = th + up + down;
        WindowHeights(plan, w, ex, ey, ew, eh);
        double low = std::numeric_limits<double>::infinity(), high = -low;
        for (int j = ty; j < ty + th; ++j)
            for (int i = tx; i < tx + tw; ++i)
                low = std::min(low, w.h[static_cast<size_t>(j - ey) * ew + (i - ex)]);
        for (const double v : w.h)
            high = std::max(high, v);  // NaN compares false and is skipped
        if (!(low <= high))
            return;  // no ground in the tile: nothing to hide
        int l, r, u, d;
        reach.Apply(plan, high - low + 1, l, r, u, d);
        if ((l <= left && r <= right && u <= up && d <= down) || round == 8)
            return;
        left = std::max(left, l), right = std::max(right, r);
        up = std::max(up, u), down = std::max(down, d);
    }
}

// The seen pixels of a tile through the job's resampler, in one call: the source window (the
// part inside the image) as a raster placed at its image position.
void ResampleWithGiven(const Plan& plan, Worker& w, TorthoResult& counts) {
    const trueortho::SourceWindow& src = w.window;
    const int x0 = std::max(src.x0, 0), y0 = std::max(src.y0, 0);
    const int x1 = std::min(src.x0 + src.width, plan.imageWidth);
    const int y1 = std::min(src.y0 + src.height, plan.imageHeight);
    const size_t tileSize = w.visibility.size(), n = w.pending.size();
    gobs::Raster raster(static_cast<unsigned int>(x1 - x0), static_cast<unsigned int>(y1 - y0),
                        static_cast<unsigned int>(src.bands), datasources::DataType::Float32);
    raster.SetOrigin(static_cast<unsigned int>(x0), static_cast<unsigned int>(y0));
    for (int b = 0; b < src.bands; ++b) {
        float* plane = static_cast<float*>(raster.GetChannelData(static_cast<unsigned int>(b)));
        for (int y = y0; y < y1; ++y)
            for (int x = x0; x < x1; ++x)
                *plane++ =
                    src.values[(static_cast<size_t>(b) * src.height + (y - src.y0)) * src.width +
                               (x - src.x0)];
    }
    std::vector<double> noData(src.bands);
    for (int b = 0; b < src.bands; ++b)
        noData[b] = src.hasNoData[b] ? src.noData[b] : std::numeric_limits<double>::quiet_NaN();
    w.resampled.resize(n * src.bands);
    plan.job->resampler->ResampleAll(raster, n, w.pendingCol.data(), w.pendingRow.data(),
                                     w.resampled.data(), noData.data());
    for (size_t k = 0; k < n; ++k) {
        const size_t o = w.pending[k];
        bool valid = true;
        for (int b = 0; b < src.bands; ++b)
            valid = valid && !std::isnan(w.resampled[b * n + k]);
        if (!valid) {
            w.visibility[o] = VISIBILITY_OUTSIDE, ++counts.outside;
            continue;
        }
        ++counts.seen;
        for (int b = 0; b < src.bands; ++b)
            w.ortho[tileSize * b + o] = static_cast<float>(w.resampled[b * n + k]);
    }
}

void ProcessTile(const Plan& plan, Worker& w, TileOutput& ortho, TileOutput& visibility, int tx,
                 int ty, int tw, int th, const RunControl& control, TorthoResult& counts) {
    const TorthoJob& job = *plan.job;
    // The tile with its surroundings, so that occluders outside the tile are projected too.
    int ex, ey, ew, eh;
    TileWindow(plan, w, tx, ty, tw, th, ex, ey, ew, eh);
    if (control.Stopped())
        return;
    const size_t n = static_cast<size_t>(ew) * eh;
    w.col.resize(n), w.row.resize(n);
    if (w.okSize < n)
        w.ok.reset(new bool[n]), w.okSize = n;
    w.projection->Project(ex, ey, ew, eh, w.h.data(), w.col.data(), w.row.data(), w.ok.get());
    auto at = [&](int i, int j) { return static_cast<size_t>(j - ey) * ew + (i - ex); };

    // The image area the tile's own ground projects into.
    double minC = std::numeric_limits<double>::infinity(), maxC = -minC, minR = minC, maxR = -minC;
    for (int j = ty; j < ty + th; ++j)
        for (int i = tx; i < tx + tw; ++i) {
            const size_t k = at(i, j);
            if (!w.ok[k])
                continue;
            minC = std::min(minC, w.col[k]), maxC = std::max(maxC, w.col[k]);
            minR = std::min(minR, w.row[k]), maxR = std::max(maxR, w.row[k]);
        }
    const bool anyInside =
        minC <= maxC && maxC >= 0 && maxR >= 0 && minC < plan.imageWidth && minR < plan.imageHeight;
    int zx0 = 0, zy0 = 0, zx1 = 0, zy1 = 0;
    if (anyInside) {
        zx0 = std::max(static_cast<int>(std::floor(minC)) - 2, 0);
        zy0 = std::max(static_cast<int>(std::floor(minR)) - 2, 0);
        zx1 = std::min(static_cast<int>(std::ceil(maxC)) + 2, plan.imageWidth);
        zy1 = std::min(static_cast<int>(std::ceil(maxR)) + 2, plan.imageHeight);
    }

    // Surface cells into the z-buffer: two triangles between each four neighbouring centres.
    w.zbuffer.Reset(zx0, zy0, zx1 - zx0, zy1 - zy0);
    if (anyInside) {
        for (int j = ey; j + 1 < ey + eh; ++j) {
            if ((j & 15) == 0 && control.Stopped())
                return;
            for (int i = ex; i + 1 < ex + ew; ++i) {
                const size_t q[4] = {at(i, j), at(i + 1, j), at(i, j + 1), at(i + 1, j + 1)};
                static const int triangles[2][3] = {{0, 1, 2}, {1, 3, 2}};
                for (const auto& t : triangles) {
                    const size_t a = q[t[0]], b = q[t[1]], c = q[t[2]];
                    if (!w.ok[a] || !w.ok[b] || !w.ok[c])
                        continue;
                    const double cols[3] = {w.col[a], w.col[b], w.col[c]};
                    const double rows[3] = {w.row[a], w.row[b], w.row[c]};
                    const double heights[3] = {w.h[a], w.h[b], w.h[c]};
                    w.zbuffer.AddTriangle(cols, rows, heights);
                }
            }
        }
    }

    // The source pixels the tile samples.
    trueortho::SourceWindow& src = w.window;
    src.imageWidth = plan.imageWidth, src.imageHeight = plan.imageHeight;
    src.bands = static_cast<int>(plan.bands.size());
    src.hasNoData = plan.hasNoData, src.noData = plan.noData;
    src.anyNoData = std::find(src.hasNoData.begin(), src.hasNoData.end(), 1) != src.hasNoData.end();
    const int radius = job.resampler != nullptr
                           ? std::max(1, static_cast<int>(job.resampler->GetRadius()))
                           : trueortho::KernelRadius(plan.kernel);
    src.x0 = zx0 - radius, src.y0 = zy0 - radius;
    src.width = anyInside ? zx1 - zx0 + 2 * radius : 0;
    src.height = anyInside ? zy1 - zy0 + 2 * radius : 0;
    src.values.assign(static_cast<size_t>(src.width) * src.height * src.bands, 0.0f);
    if (anyInside)
        ReadSource(plan, w.source.get(), src.x0, src.y0, src.width, src.height, src.values.data());

    // Each output pixel: seen, hidden, outside, or without height.
    const size_t tileSize = static_cast<size_t>(tw) * th;
    w.ortho.assign(tileSize * src.bands, static_cast<float>(job.orthoNoData));
    w.visibility.assign(tileSize, static_cast<float>(VISIBILITY_OUTSIDE));
    std::vector<float> value(src.bands);
    w.pending.clear(), w.pendingCol.clear(), w.pendingRow.clear();
    for (int j = ty; j < ty + th; ++j) {
        if ((j & 15) == 0 && control.Stopped())
            return;
        for (int i = tx; i < tx + tw; ++i) {
            const size_t k = at(i, j), o = static_cast<size_t>(j - ty) * tw + (i - tx);
            if (std::isnan(w.h[k])) {
                w.visibility[o] = VISIBILITY_NODATA, ++counts.noHeight;
                continue;
            }
            const double c = w.col[k], r = w.row[k];
            if (!w.ok[k] || !(c >= 0 && r >= 0 && c < plan.imageWidth && r < plan.imageHeight)) {
                ++counts.outside;
                continue;
            }
            if (w.h[k] + job.heightTolerance < w.zbuffer.SurfaceBound(c, r)) {
                w.visibility[o] = VISIBILITY_HIDDEN, ++counts.hidden;
                continue;
            }
            if (job.resampler != nullptr) {
                w.visibility[o] = VISIBILITY_SEEN;  // unless the resampler finds no value
                w.pending.push_back(o), w.pendingCol.push_back(c), w.pendingRow.push_back(r);
                continue;
            }
            if (!trueortho::Sample(src, plan.kernel, c, r, value.data())) {
                ++counts.outside;
                continue;
            }
            w.visibility[o] = VISIBILITY_SEEN, ++counts.seen;
            for (int b = 0; b < src.bands; ++b)
                w.ortho[tileSize * b + o] = value[b];
        }
    }
    if (!w.pending.empty())
        ResampleWithGiven(plan, w, counts);
    ortho.Write(tx, ty, tw, th, w.ortho.data());
    visibility.Write(tx, ty, tw, th, w.visibility.data());
}

void Require(bool condition, const std::string& message, const SourceLocation& where) {
    if (!condition)
        KESTREL_THROW_AT(where, DataException, message);
}

void ReadFileSource(const TorthoJob& job, GDALDataset& source, Plan& plan,
                    const SourceLocation& where);

// Checks the job and opens what the tiles share; throws DataException saying what is wrong.
Plan MakePlan(const TorthoJob& job, GDALDataset* source) {
    const SourceLocation where = KESTREL_HERE;
    Require(job.model != nullptr, "True ortho: no math model given", where);
    Require(job.surface != nullptr, "True ortho: no surface model given", where);
    Require(job.crs != nullptr, "True ortho: the output layout has no coordinate system", where);
    Require(job.pixels > 0 && job.lines > 0,
            FormatString("True ortho: the output layout has %u pixels and %u lines; both must "
                         "be at least 1",
                         job.pixels, job.lines),
            where);
    Require(job.pixels <= 1u << 30 && job.lines <= 1u << 30,
            FormatString("True ortho: output layout of %u x %u pixels is too large", job.pixels,
                         job.lines),
            where);
    Require((job.orthoWriter == nullptr) == (job.visibilityWriter == nullptr),
            "True ortho: give writers for both the ortho and the visibility index, or for neither",
            where);
    if (job.orthoWriter != nullptr)
        Require(job.orthoWriter != job.visibilityWriter,
                "True ortho: the ortho and the visibility index need two different writers", where);
    else
        Require(!job.orthoPath.empty() && !job.visibilityPath.empty() &&
                    job.orthoPath != job.visibilityPath,
                "True ortho: the ortho and the visibility index need two different output paths",
                where);
    Require(job.tileSize >= 16 && job.tileSize <= 8192,
            FormatString("True ortho: tile size %u is outside 16 to 8192", job.tileSize), where);
    Require(std::isfinite(job.errorThreshold) && job.errorThreshold >= 0,
            FormatString("True ortho: error threshold %g must be finite and not negative",
                         job.errorThreshold),
            where);
    Require(std::isfinite(job.heightTolerance) && job.heightTolerance >= 0,
            FormatString("True ortho: height tolerance %g must be finite and not negative",
                         job.heightTolerance),
            where);

    Plan plan;
    plan.job = &job;
    plan.kernel =
        job.resampler != nullptr ? Kernel::Bilinear : trueortho::KernelByName(job.resampling);
    if (job.source != nullptr) {
        datasources::IRasterReader& reader = *job.source;
        plan.reader = &reader;
        plan.sourceName = reader.GetPath();
        plan.imageWidth = static_cast<int>(reader.GetWidth());
        plan.imageHeight = static_cast<int>(reader.GetHeight());
        plan.dataType = static_cast<GDALDataType>(reader.GetDataType());
        for (unsigned int c = 0; c < reader.GetChannelCount(); ++c) {
            plan.bands.push_back(static_cast<int>(c + 1));
            double nd = 0;
            const bool has = reader.GetNoDataValue(c, nd);
            plan.hasNoData.push_back(has ? 1 : 0);
            plan.noData.push_back(static_cast<float>(nd));
        }
        Require(!plan.bands.empty(), "True ortho: the source reader has no channels", where);
    } else {
        ReadFileSource(job, *source, plan, where);
    }
    Require(job.model->GetImageWidth() == static_cast<unsigned int>(plan.imageWidth) &&
                job.model->GetImageHeight() == static_cast<unsigned int>(plan.imageHeight),
            FormatString("True ortho: the math model is for a %u x %u image, but %s is %d x %d",
                         job.model->GetImageWidth(), job.model->GetImageHeight(),
                         plan.sourceName.c_str(), plan.imageWidth, plan.imageHeight),
            where);
    return plan;
}

// The plan's source from the file at job.sourcePath: its size, channels and no-data values.
void ReadFileSource(const TorthoJob& job, GDALDataset& source, Plan& plan,
                    const SourceLocation& where) {
    plan.sourceName = job.sourcePath;
    plan.imageWidth = source.GetRasterXSize();
    plan.imageHeight = source.GetRasterYSize();
    const int count = source.GetRasterCount();
    std::vector<unsigned int> channels = job.channels;
    if (channels.empty())
        for (int b = 1; b <= count; ++b)
            channels.push_back(static_cast<unsigned int>(b));
    GDALDataType type = GDT_Unknown;
    for (unsigned int c : channels) {
        Require(c >= 1 && c <= static_cast<unsigned int>(count),
                FormatString("True ortho: channel %u of %s does not exist (it has %d)", c,
                             job.sourcePath.c_str(), count),
                where);
        GDALRasterBand* band = source.GetRasterBand(static_cast<int>(c));
        if (type == GDT_Unknown)
            type = band->GetRasterDataType();
        Require(band->GetRasterDataType() == type,
                FormatString("True ortho: channels of %s have different data types (%s and %s); "
                             "one ortho holds one data type",
                             job.sourcePath.c_str(), GDALGetDataTypeName(type),
                             GDALGetDataTypeName(band->GetRasterDataType())),
                where);
        plan.bands.push_back(static_cast<int>(c));
        int has = 0;
        const double nd = band->GetNoDataValue(&has);
        plan.hasNoData.push_back(has ? 1 : 0);
        plan.noData.push_back(static_cast<float>(nd));
    }
    plan.dataType = type;
}

// The surface must meet the output grid; where it does not cover the grid, the visibility index
// says "no height".
void CheckSurfaceCovers(const TorthoJob& job) {
    double minX, minY, maxX, maxY;
    job.surface->GetExtent(minX, minY, maxX, maxY);
    const ogc::cs::ICRS* surfaceCrs = job.surface->GetCRS();
    std::array<double, 4> gx, gy;
    const double corners[4][2] = {{0.5, 0.5},
                                  {job.pixels - 0.5, 0.5},
                                  {0.5, job.lines - 0.5},
                                  {job.pixels - 0.5, job.lines - 0.5}};
    for (int k = 0; k < 4; ++k)
        job.geocoding.PixelToGround(corners[k][0], corners[k][1], gx[k], gy[k]);
    if (surfaceCrs != nullptr && !surfaceCrs->IsSame(*job.crs))
        ogc::cs::CoordinateTransformation(*job.crs, *surfaceCrs).Transform(4, gx.data(), gy.data());
    const auto xs = std::minmax_element(gx.begin(), gx.end());
    const auto ys = std::minmax_element(gy.begin(), gy.end());
    if (!(*xs.second >= minX && *xs.first <= maxX && *ys.second >= minY && *ys.first <= maxY))
        KESTREL_THROW(DataException,
                      FormatString("True ortho: the surface model (%.3f, %.3f to %.3f, %.3f) "
                                   "does not meet the output grid (%.3f, %.3f to %.3f, %.3f)",
                                   minX, minY, maxX, maxY, *xs.first, *ys.first, *xs.second,
                                   *ys.second));
}

// Looks at the grid through the model on a sparse sample: the surface's height range, how far
// occluders can stand from the ground they hide, and whether the image is reached at all.
void Survey(const TorthoJob& job, Plan& plan, Worker& w, const RunControl& control) {
    // Heights on every second pixel and line, kept as the lowest and highest of each block: a
    // tile's first estimate of the surface within its reach. Heights that are not finite are
    // no heights.
    HeightBlocks& blocks = plan.blocks;
    const int size = HeightBlocks::kSize;
    blocks.columns = static_cast<int>((job.pixels + size - 1) / size);
    blocks.rows = static_cast<int>((job.lines + size - 1) / size);
    blocks.low.assign(static_cast<size_t>(blocks.columns) * blocks.rows,
                      std::numeric_limits<float>::infinity());
    blocks.high.assign(blocks.low.size(), -std::numeric_limits<float>::infinity());
    bool any = false;
    const unsigned int cols = (job.pixels + 1) / 2;
    std::vector<double> x(static_cast<size_t>(cols) * size / 2), y(x.size()), h(x.size());
    for (unsigned int y0 = 0; y0 < job.lines && !control.Stopped(); y0 += size) {
        const unsigned int rows = std::min<unsigned int>(size / 2, (job.lines - y0 + 1) / 2);
        const size_t n = static_cast<size_t>(rows) * cols;
        for (unsigned int j = 0; j < rows; ++j)
            for (unsigned int i = 0; i < cols; ++i)
                job.geocoding.PixelToGround(2 * i + 0.5, y0 + 2 * j + 0.5,
                                            x[static_cast<size_t>(j) * cols + i],
                                            y[static_cast<size_t>(j) * cols + i]);
        job.surface->GetHeights(n, x.data(), y.data(), h.data());
        const size_t line = static_cast<size_t>(y0 / size) * blocks.columns;
        for (size_t k = 0; k < n; ++k) {
            if (!std::isfinite(h[k]))
                continue;
            const size_t b = line + (k % cols) * 2 / size;
            const float v = static_cast<float>(h[k]);
            blocks.low[b] = std::min(blocks.low[b], v), blocks.high[b] = std::max(blocks.high[b], v);
            any = true;
        }
    }
    if (control.Stopped())
        return;
    if (!any)
        KESTREL_THROW(DataException,
                      "True ortho: the surface model has no height anywhere on the output grid");

    // The line of sight on a 17 x 17 lattice: the extension for tiles whose own corners tell
    // nothing, and whether any ground reaches the image. A grid that the lattice misses (a thin
    // sliver of the image, where an area of interest clips a scene's window) is looked at again
    // on every pixel centre, up to 256 x 256 of them, before it is refused.
    int inside = 0;
    Extension global;
    const auto look = [&](unsigned int columns, unsigned int rows) {
        for (unsigned int a = 0; a < columns; ++a)
            for (unsigned int b = 0; b < rows; ++b) {
                bool inImage = false;
                global.Add(plan, w, job.pixels * (a + 0.5) / columns,
                           job.lines * (b + 0.5) / rows, &inImage);
                inside += inImage;
            }
    };
    look(17, 17);
    if (inside == 0)
        look(std::min(job.pixels, 256u), std::min(job.lines, 256u));
    if (inside == 0)
        KESTREL_THROW(DataException,
                      FormatString("True ortho: the math model projects the output grid outside "
                                   "the image %s (%d x %d): layout and image do not match",
                                   plan.sourceName.c_str(), plan.imageWidth, plan.imageHeight));
    plan.global = global;
}

}  // namespace

TorthoResult TorthoGenerator::Generate(const TorthoJob& job) {
    RunControl control(CancelFlag(), Progress(), ProgressData());
    DatasetPtr source;
    if (job.source == nullptr)
        source = trueortho::OpenRaster(job.sourcePath, "source image");
    std::mutex readLock;
    Plan plan = MakePlan(job, source.get());
    plan.readLock = &readLock;
    // Outputs given by path: writers of the generator's own, made now so that a format or
    // option GDAL cannot write is refused before any work. Destroyed unclosed, after a
    // cancelled or failed run, they leave nothing.
    const auto ownOrtho = OutputWriter(job, job.orthoPath, plan.bands.size(), false);
    const auto ownVisibility = OutputWriter(job, job.visibilityPath, 1, true);
    job.surface->SetInputCRS(job.crs);
    CheckSurfaceCovers(job);
    std::unique_ptr<ogc::cs::CoordinateTransformation> toModel;
    if (job.model->GetCRS() != nullptr && !job.model->GetCRS()->IsSame(*job.crs))
        toModel =
            std::make_unique<ogc::cs::CoordinateTransformation>(*job.crs, *job.model->GetCRS());
    {
        Worker surveyor;
        if (toModel)
            surveyor.toModel = std::make_unique<ogc::cs::CoordinateTransformation>(*toModel);
        Survey(job, plan, surveyor, control);
    }
    TorthoResult result;
    if (control.Stopped())
        return result;

    TileOutput ortho(job, ownOrtho ? *ownOrtho : *job.orthoWriter,
                     static_cast<int>(plan.bands.size()), plan.dataType, job.orthoNoData);
    TileOutput visibility(job, ownVisibility ? *ownVisibility : *job.visibilityWriter, 1,
                          GDT_Byte, VISIBILITY_NODATA);

    const unsigned int tile = job.tileSize;
    const unsigned int tilesX = (job.pixels + tile - 1) / tile,
                       tilesY = (job.lines + tile - 1) / tile;
    // No more threads than tiles, before anything per thread is made.
    const size_t tiles = static_cast<size_t>(tilesX) * tilesY;
    std::vector<TorthoResult> counts(std::min<size_t>(ThreadsToUse(), tiles));
    std::vector<std::unique_ptr<Worker>> workers(counts.size());
    control.RunTiles(
        tiles, static_cast<unsigned int>(counts.size()),
        "True ortho", [&](unsigned int thread, size_t index) {
            std::unique_ptr<Worker>& w = workers[thread];
            if (!w) {
                w = std::make_unique<Worker>();
                if (plan.reader == nullptr)
                    w->source = trueortho::OpenRaster(job.sourcePath, "source image");
                if (toModel)
                    w->toModel = std::make_unique<ogc::cs::CoordinateTransformation>(*toModel);
                w->projection = std::make_unique<GridProjection>(
                    job.geocoding, *job.model, w->toModel.get(), job.errorThreshold);
            }
            const int tx = static_cast<int>((index % tilesX) * tile);
            const int ty = static_cast<int>((index / tilesX) * tile);
            const int tw = static_cast<int>(std::min(tile, job.pixels - tx));
            const int th = static_cast<int>(std::min(tile, job.lines - ty));
            ProcessTile(plan, *w, ortho, visibility, tx, ty, tw, th, control, counts[thread]);
        });
    if (control.Stopped())
        return result;  // the writers are left unclosed
    ortho.Commit();
    visibility.Commit();
    for (const TorthoResult& c : counts) {
        result.seen += c.seen, result.hidden += c.hidden;
        result.outside += c.outside, result.noHeight += c.noHeight;
    }
    result.completed = true;
    return result;
}

std::string SceneRasterOptions(const std::string& format, bool classes) {
    if (format == "GTiff")
        return classes ? "ZLEVEL=1 PREDICTOR=1" : "ZLEVEL=1 BLOCKXSIZE=128 BLOCKYSIZE=128";
    return classes && format == "COG" ? "OVERVIEW_RESAMPLING=NEAREST PREDICTOR=NO" : "";
}

}  // namespace processes
}  // namespace kestrel
