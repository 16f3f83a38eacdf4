// Occlusion recovery: the true-ortho mosaic of several orthos on one grid, each pixel taken
// from the scene that sees it best.
#include <kestrel/exception.h>
#include <kestrel/raster.h>
#include <kestrel/rasterio.h>
#include <kestrel/trueortho.h>

#include "../datasources/gdaldataset.h"
#include "../gdalsupport.h"
#include "rasterfiles.h"
#include "runcontrol.h"

#include <gdal_priv.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <limits>
#include <mutex>

namespace kestrel {
namespace processes {

using trueortho::DatasetPtr;
using trueortho::RunControl;

namespace {

// Angles are computed on a coarser lattice and interpolated: they change slowly.
constexpr int kAngleStep = 16;
constexpr float kUnknownAngle = std::numeric_limits<float>::infinity();

struct SceneInfo {
    int bands = 0;
    bool hasNoData = false;
    double noData = 0;
};

// A scene's rasters, opened once for the whole run and shared by the threads. GDAL datasets
// serve one thread at a time, hence the lock; threads start on different scenes so that they
// seldom wait for each other.
struct SceneFiles {
    DatasetPtr ortho, visibility;
    std::mutex mutex;
};

struct Grid {
    unsigned int pixels = 0, lines = 0;
    int bands = 0;
    GDALDataType type = GDT_Unknown;
    std::array<double, 6> geoTransform{};
    std::unique_ptr<ogc::cs::ICRS> crs;
    std::vector<SceneInfo> scenes;
    std::vector<std::unique_ptr<SceneFiles>> files;
    int halo = 0;  // the largest pixel error
    std::unique_ptr<SceneFiles> mask;  // RecoveryJob::maskPath, in `ortho`
};

// The choice for one pixel among the scenes that see it. Lower ranks first:
//   1. seen clearly: no hidden pixel of the scene within its DBM pixel error (the visibility
//      test's tolerance), so an error of the surface model cannot have put the pixel on the
//      wrong side of an occlusion edge;
//   2. the lower radiometric difference level;
//   3. the line of sight nearer the vertical (a known angle before an unknown one);
//   4. the scene listed first.
struct Rank {
    static constexpr size_t kNone = std::numeric_limits<size_t>::max();
    int unclear = 0, level = 0;
    float angle = kUnknownAngle;
    size_t index = kNone;
    bool operator<(const Rank& o) const {
        if (o.index == kNone || index == kNone)
            return o.index == kNone && index != kNone;
        if (unclear != o.unclear)
            return unclear < o.unclear;
        if (level != o.level)
            return level < o.level;
        if (angle != o.angle)
            return angle < o.angle;
        return index < o.index;
    }
};

// One thread's buffers, reused from tile to tile; they hold one scene at a time, so a thread's
// memory does not grow with the number of scenes.
struct Worker {
    std::vector<std::unique_ptr<ogc::cs::CoordinateTransformation>> toModel;  // made when needed
    std::vector<float> visibility, values, angle;
    std::vector<int> nearHidden;
    std::vector<unsigned char> unclear;
    std::vector<Rank> best;
    std::vector<size_t> taken;
};

bool SameGeoTransform(const std::array<double, 6>& a, const std::array<double, 6>& b) {
    const double pixel = std::max(std::fabs(a[1]) + std::fabs(a[2]), 1e-12);
    for (int k : {0, 3})
        if (std::fabs(a[k] - b[k]) > 1e-6 * pixel)
            return false;
    for (int k : {1, 2, 4, 5})
        if (std::fabs(a[k] - b[k]) > 1e-9 * pixel)
            return false;
    return true;
}

// Opens every scene (for the whole run) and checks that they share one grid, data type and channel
// count.
Grid Inspect(const RecoveryJob& job) {
    if (job.scenes.empty())
        KESTREL_THROW(DataException, "Occlusion recovery: no scenes given");
    if (job.mosaicPath.empty() || job.sourcePath.empty() || job.mosaicPath == job.sourcePath)
        KESTREL_THROW(DataException,
                      "Occlusion recovery: the mosaic and the source raster need two different "
                      "output paths");
    if (job.tileSize < 16 || job.tileSize > 8192)
        KESTREL_THROW(DataException, FormatString("Occlusion recovery: tile size %u is outside "
                                                  "16 to 8192",
                                                  job.tileSize));
    Grid grid;
    for (size_t s = 0; s < job.scenes.size(); ++s) {
        const RecoveryScene& scene = job.scenes[s];
        if (scene.dbmPixelError < 0 || scene.dbmPixelError > 1000)
            KESTREL_THROW(DataException,
                          FormatString("Occlusion recovery: scene %zu (%s) has DBM pixel error "
                                       "%d; expected 0 to 1000",
                                       s + 1, scene.orthoPath.c_str(), scene.dbmPixelError));
        grid.halo = std::max(grid.halo, scene.dbmPixelError);
        grid.files.push_back(std::make_unique<SceneFiles>());
        DatasetPtr& ortho = grid.files.back()->ortho;
        DatasetPtr& visibility = grid.files.back()->visibility;
        ortho = trueortho::OpenRaster(scene.orthoPath, "ortho");
        visibility = trueortho::OpenRaster(scene.visibilityPath, "visibility index");
        std::array<double, 6> gt{};
        const bool georeferenced = ortho->GetGeoTransform(gt.data()) == CE_None;
        GDALRasterBand* first = ortho->GetRasterBand(1);
        if (!georeferenced || first == nullptr)
            KESTREL_THROW(DataException,
                          FormatString("Occlusion recovery: %s has no %s", scene.orthoPath.c_str(),
                                       georeferenced ? "channels" : "georeferencing"));
        const unsigned int pixels = static_cast<unsigned int>(ortho->GetRasterXSize());
        const unsigned int lines = static_cast<unsigned int>(ortho->GetRasterYSize());
        if (s == 0) {
            grid.pixels = pixels, grid.lines = lines, grid.geoTransform = gt;
            grid.bands = ortho->GetRasterCount();
            grid.type = first->GetRasterDataType();
            if (const OGRSpatialReference* srs = ortho->GetSpatialRef())
                grid.crs = std::make_unique<ogc::cs::ICRS>(*srs);
        } else {
            if (pixels != grid.pixels || lines != grid.lines ||
                !SameGeoTransform(gt, grid.geoTransform))
                KESTREL_THROW(
                    DataException,
                    FormatString("Occlusion recovery: %s (%u x %u) is not on the grid "
                                 "of %s (%u x %u); the orthos of one image set must "
                                 "share one grid",
                                 scene.orthoPath.c_str(), pixels, lines,
                                 job.scenes[0].orthoPath.c_str(), grid.pixels, grid.lines));
            if (ortho->GetRasterCount() != grid.bands || first->GetRasterDataType() != grid.type)
                KESTREL_THROW(DataException,
                              FormatString("Occlusion recovery: %s has %d channels of %s, but %s "
                                           "has %d of %s",
                                           scene.orthoPath.c_str(), ortho->GetRasterCount(),
                                           GDALGetDataTypeName(first->GetRasterDataType()),
                                           job.scenes[0].orthoPath.c_str(), grid.bands,
                                           GDALGetDataTypeName(grid.type)));
        }
        if (static_cast<unsigned int>(visibility->GetRasterXSize()) != pixels ||
            static_cast<unsigned int>(visibility->GetRasterYSize()) != lines)
            KESTREL_THROW(
                DataException,
                FormatString("Occlusion recovery: the visibility index %s (%d x %d) "
                             "does not match its ortho %s (%u x %u)",
                             scene.visibilityPath.c_str(), visibility->GetRasterXSize(),
                             visibility->GetRasterYSize(), scene.orthoPath.c_str(), pixels, lines));
        SceneInfo info;
        info.bands = ortho->GetRasterCount();
        int has = 0;
        info.noData = first->GetNoDataValue(&has);
        info.hasNoData = has != 0;
        grid.scenes.push_back(info);
    }
    return grid;
}

// Tangent of the angle between the vertical and the line of sight at a ground point: the
// horizontal distance the line of sight travels per metre of height.
float OffNadir(const mathmodel::IMathModel& model, const ogc::cs::CoordinateTransformation* toModel,
               double x, double y, double h) {
    double gx[4] = {x, x + 1, x, x}, gy[4] = {y, y, y + 1, y}, gz[4] = {h, h, h, h + 1};
    double c[4], r[4];
    bool ok[4];
    if (toModel != nullptr && !toModel->Transform(4, gx, gy))
        return kUnknownAngle;
    model.GroundToImage(4, gx, gy, gz, c, r, ok);
    if (!(ok[0] && ok[1] && ok[2] && ok[3]))
        return kUnknownAngle;
    const double a = c[1] - c[0], b = c[2] - c[0], d = r[1] - r[0], e = r[2] - r[0];
    const double det = a * e - b * d;
    if (!(std::fabs(det) > 1e-15))
        return kUnknownAngle;
    const double dc = c[3] - c[0], dr = r[3] - r[0];
    const double dx = (e * dc - b * dr) / det, dy = (-d * dc + a * dr) / det;
    return static_cast<float>(std::hypot(dx, dy));
}

// The viewing angles of a scene over a tile, interpolated from a lattice.
void Angles(const RecoveryJob& job, const Grid& grid, const RecoveryScene& scene,
            const ogc::cs::CoordinateTransformation* toModel, int tx, int ty, int tw, int th,
            std::vector<float>& out) {
    out.assign(static_cast<size_t>(tw) * th, kUnknownAngle);
    if (scene.model == nullptr || job.surface == nullptr)
        return;
    const int nx = (tw + kAngleStep - 1) / kAngleStep + 1,
              ny = (th + kAngleStep - 1) / kAngleStep + 1;
    std::vector<float> lattice(static_cast<size_t>(nx) * ny);
    const auto& g = grid.geoTransform;
    for (int b = 0; b < ny; ++b)
        for (int a = 0; a < nx; ++a) {
            const double p = tx + std::min(a * kAngleStep, tw - 1) + 0.5;
            const double l = ty + std::min(b * kAngleStep, th - 1) + 0.5;
            const double x = g[0] + p * g[1] + l * g[2], y = g[3] + p * g[4] + l * g[5];
            double h;
            lattice[static_cast<size_t>(b) * nx + a] =
                job.surface->GetHeight(x, y, h) ? OffNadir(*scene.model, toModel, x, y, h)
                                                : kUnknownAngle;
        }
    // Between lattice nodes, which stand every kAngleStep pixels and on the last one.
    auto cell = [](int i, int size, int& node, double& f) {
        node = i / kAngleStep;
        const int p0 = std::min(node * kAngleStep, size - 1);
        const int p1 = std::min((node + 1) * kAngleStep, size - 1);
        f = p1 > p0 ? static_cast<double>(i - p0) / (p1 - p0) : 0.0;
    };
    for (int j = 0; j < th; ++j) {
        int b;
        double fy;
        cell(j, th, b, fy);
        for (int i = 0; i < tw; ++i) {
            int a;
            double fx;
            cell(i, tw, a, fx);
            const size_t k = static_cast<size_t>(b) * nx + a;
            const float q[4] = {lattice[k], lattice[k + 1], lattice[k + nx], lattice[k + nx + 1]};
            if (std::isinf(q[0]) || std::isinf(q[1]) || std::isinf(q[2]) || std::isinf(q[3]))
                continue;  // unknown
            out[static_cast<size_t>(j) * tw + i] = static_cast<float>(
                (1 - fy) * ((1 - fx) * q[0] + fx * q[1]) + fy * ((1 - fx) * q[2] + fx * q[3]));
        }
    }
}

// Marks the tile's pixels that have a hidden pixel within e pixels (a square neighbourhood).
// `vis` is the tile with a border of e pixels (vw x vh). Counts of hidden pixels slide along
// each row and then down each column, so the cost per pixel does not depend on e.
void MarkNearHidden(const std::vector<float>& vis, int vw, int vh, int tw, int th, int e,
                    std::vector<int>& rowCounts, std::vector<unsigned char>& unclear) {
    const int span = 2 * e + 1;
    auto hidden = [](float v) { return v == VISIBILITY_HIDDEN ? 1 : 0; };
    // rowCounts[r * tw + i]: hidden pixels of border row r in columns i to i + 2e.
    rowCounts.assign(static_cast<size_t>(vh) * tw, 0);
    for (int r = 0; r < vh; ++r) {
        const float* line = vis.data() + static_cast<size_t>(r) * vw;
        int* counts = rowCounts.data() + static_cast<size_t>(r) * tw;
        int count = 0;
        for (int c = 0; c < span - 1; ++c)
            count += hidden(line[c]);
        for (int i = 0; i < tw; ++i) {
            count += hidden(line[i + span - 1]);
            counts[i] = count;
            count -= hidden(line[i]);
        }
    }
    // Then over rows j to j + 2e of those counts.
    std::vector<int> column(tw, 0);
    for (int r = 0; r < span - 1; ++r)
        for (int i = 0; i < tw; ++i)
            column[i] += rowCounts[static_cast<size_t>(r) * tw + i];
    unclear.assign(static_cast<size_t>(tw) * th, 0);
    for (int j = 0; j < th; ++j) {
        const int* entering = rowCounts.data() + static_cast<size_t>(j + span - 1) * tw;
        const int* leaving = rowCounts.data() + static_cast<size_t>(j) * tw;
        unsigned char* out = unclear.data() + static_cast<size_t>(j) * tw;
        for (int i = 0; i < tw; ++i) {
            column[i] += entering[i];
            out[i] = column[i] > 0;
            column[i] -= leaving[i];
        }
    }
}

struct Tile {
    int x, y, width, height;
    size_t Size() const { return static_cast<size_t>(width) * height; }
};

// Offers scene s for the tile's pixels: where it sees a pixel and ranks before the best so far,
// it becomes the pixel's source and its values go into the mosaic.
void OfferScene(const RecoveryJob& job, const Grid& grid, size_t s, Worker& w, const Tile& t,
                const ogc::cs::CoordinateTransformation* toModel, gobs::Raster& mosaic,
                gobs::Raster& source) {
    const RecoveryScene& scene = job.scenes[s];
    SceneFiles& files = *grid.files[s];
    const int e = scene.dbmPixelError;
    const int vw = t.width + 2 * e, vh = t.height + 2 * e;
    w.visibility.assign(static_cast<size_t>(vw) * vh, VISIBILITY_OUTSIDE);
    {
        std::lock_guard<std::mutex> lock(files.mutex);
        trueortho::ReadWindow(*files.visibility, scene.visibilityPath, {1}, t.x - e, t.y - e, vw,
                              vh, w.visibility.data());
    }
    auto seen = [&](int i, int j) {
        return w.visibility[static_cast<size_t>(j + e) * vw + i + e] == VISIBILITY_SEEN;
    };
    bool seesAny = false;
    for (int j = 0; j < t.height && !seesAny; ++j)
        for (int i = 0; i < t.width && !seesAny; ++i)
            seesAny = seen(i, j);
    if (!seesAny)
        return;
    MarkNearHidden(w.visibility, vw, vh, t.width, t.height, e, w.nearHidden, w.unclear);
    Angles(job, grid, scene, toModel, t.x, t.y, t.width, t.height, w.angle);

    w.taken.clear();
    for (int j = 0; j < t.height; ++j)
        for (int i = 0; i < t.width; ++i) {
            const size_t o = static_cast<size_t>(j) * t.width + i;
            if (!seen(i, j))
                continue;
            const Rank rank{w.unclear[o], scene.radiometricLevel, w.angle[o], s};
            if (rank < w.best[o])
                w.best[o] = rank, w.taken.push_back(o);
        }
    if (w.taken.empty())
        return;
    std::vector<int> allBands(grid.bands);
    for (int b = 0; b < grid.bands; ++b)
        allBands[b] = b + 1;
    const size_t size = t.Size();
    w.values.assign(size * grid.bands, 0.0f);
    {
        std::lock_guard<std::mutex> lock(files.mutex);
        trueortho::ReadWindow(*files.ortho, scene.orthoPath, allBands, t.x, t.y, t.width, t.height,
                              w.values.data());
    }
    float* out = static_cast<float*>(mosaic.GetData());
    float* from = static_cast<float*>(source.GetData());
    for (const size_t o : w.taken) {
        from[o] = static_cast<float>(s + 1);
        for (int b = 0; b < grid.bands; ++b)
            out[size * b + o] = w.values[size * b + o];
    }
}

void ProcessTile(const RecoveryJob& job, const Grid& grid, Worker& w,
                 const std::vector<std::unique_ptr<ogc::cs::CoordinateTransformation>>& toModel,
                 datasources::BasicWriter& mosaicOut, datasources::BasicWriter& sourceOut,
                 const Tile& t, size_t tileIndex, const RunControl& control,
                 TorthoRecoveryResult& counts) {
    const size_t scenes = job.scenes.size();
    const SceneInfo& first = grid.scenes[0];
    gobs::Raster mosaic(t.width, t.height, grid.bands, datasources::DataType::Float32,
                        gobs::Raster::Initial::Unset);
    gobs::Raster source(t.width, t.height, 1, datasources::DataType::Float32);
    std::fill_n(static_cast<float*>(mosaic.GetData()), mosaic.GetPlaneSize() * grid.bands,
                static_cast<float>(first.hasNoData ? first.noData : 0));
    w.best.assign(t.Size(), Rank());
    w.toModel.resize(scenes);
    for (size_t k = 0; k < scenes; ++k) {
        if (control.Stopped())
            return;
        const size_t s = (tileIndex + k) % scenes;
        if (toModel[s] && !w.toModel[s])
            w.toModel[s] = std::make_unique<ogc::cs::CoordinateTransformation>(*toModel[s]);
        OfferScene(job, grid, s, w, t, w.toModel[s].get(), mosaic, source);
    }
    if (grid.mask) {
        // Outside the mask the pixels stay empty.
        w.values.assign(t.Size(), 0.0f);
        {
            std::lock_guard<std::mutex> lock(grid.mask->mutex);
            trueortho::ReadWindow(*grid.mask->ortho, job.maskPath, {1}, t.x, t.y, t.width,
                                  t.height, w.values.data());
        }
        float* out = static_cast<float*>(mosaic.GetData());
        float* from = static_cast<float*>(source.GetData());
        const size_t size = t.Size();
        for (size_t o = 0; o < size; ++o) {
            if (w.values[o] != 0.0f || w.best[o].index == Rank::kNone)
                continue;
            w.best[o] = Rank();
            from[o] = 0.0f;
            for (int b = 0; b < grid.bands; ++b)
                out[size * b + o] = static_cast<float>(first.hasNoData ? first.noData : 0);
        }
    }
    for (const Rank& rank : w.best)
        ++(rank.index == Rank::kNone ? counts.unfilled : counts.filled);
    mosaicOut.WriteWindow(mosaic, t.x, t.y);
    sourceOut.WriteWindow(source, t.x, t.y);
}

// A writer of one of the outputs on the common grid.
std::unique_ptr<datasources::BasicWriter> OutputWriter(const std::string& path,
                                                       const std::string& format,
                                                       const std::string& options, const Grid& grid,
                                                       int bands, GDALDataType type,
                                                       double noData) {
    std::vector<unsigned int> channels(bands);
    for (int b = 0; b < bands; ++b)
        channels[b] = b + 1;
    auto writer = std::make_unique<datasources::BasicWriter>(path, channels, format, options);
    writer->SetSize(grid.pixels, grid.lines);
    writer->SetDataType(datasources::FromGDAL(type));
    writer->SetCRS(grid.crs.get());
    writer->SetGeocoding(ogc::cs::GeocodingInfo(grid.geoTransform));
    writer->SetNoDataValue(noData);
    return writer;
}

}  // namespace

TorthoRecoveryResult OcclusionRecovery::Recover(const RecoveryJob& job) {
    RunControl control(CancelFlag(), Progress(), ProgressData());
    Grid grid = Inspect(job);
    std::vector<std::unique_ptr<ogc::cs::CoordinateTransformation>> toModel(job.scenes.size());
    if (job.surface != nullptr && grid.crs)
        job.surface->SetInputCRS(grid.crs.get());
    for (size_t s = 0; s < job.scenes.size(); ++s) {
        const mathmodel::IMathModel* model = job.scenes[s].model;
        if (model != nullptr && model->GetCRS() != nullptr && grid.crs &&
            !model->GetCRS()->IsSame(*grid.crs))
            toModel[s] =
                std::make_unique<ogc::cs::CoordinateTransformation>(*grid.crs, *model->GetCRS());
    }
    TorthoRecoveryResult result;
    if (control.Stopped())
        return result;
    if (!job.maskPath.empty()) {
        grid.mask = std::make_unique<SceneFiles>();
        grid.mask->ortho = trueortho::OpenRaster(job.maskPath, "mask");
    }

    const SceneInfo& first = grid.scenes[0];
    const bool cog = job.format == "COG";
    auto mosaic = OutputWriter(job.mosaicPath, job.format, job.mosaicOptions, grid, grid.bands,
                               grid.type, first.hasNoData ? first.noData : 0.0);
    if (cog)
        mosaic->SetNoDataAsMask();
    auto source = OutputWriter(job.sourcePath, job.format, cog ? "OVERVIEW_RESAMPLING=NEAREST" : "",
                               grid, 1, job.scenes.size() < 255 ? GDT_Byte : GDT_UInt16, 0.0);

    // Each tile reads the visibility with a border of the pixel error: tiles of at least twice
    // that (up to 1024) keep the border's share of the reading bounded.
    const unsigned int tile =
        std::max(job.tileSize, std::min(2u * static_cast<unsigned int>(grid.halo), 1024u));
    const unsigned int tilesX = (grid.pixels + tile - 1) / tile;
    const unsigned int tilesY = (grid.lines + tile - 1) / tile;
    const size_t tiles = static_cast<size_t>(tilesX) * tilesY;
    const unsigned int threads = static_cast<unsigned int>(std::min<size_t>(ThreadsToUse(), tiles));
    std::vector<TorthoRecoveryResult> counts(threads);
    std::vector<Worker> workers(threads);
    control.RunTiles(tiles, threads, "Occlusion recovery", [&](unsigned int thread, size_t index) {
        const int tx = static_cast<int>((index % tilesX) * tile);
        const int ty = static_cast<int>((index / tilesX) * tile);
        const Tile t{tx, ty, static_cast<int>(std::min(tile, grid.pixels - tx)),
                     static_cast<int>(std::min(tile, grid.lines - ty))};
        ProcessTile(job, grid, workers[thread], toModel, *mosaic, *source, t, index, control,
                    counts[thread]);
    });
    if (control.Stopped())
        return result;
    mosaic->Close();
    source->Close();
    for (const auto& c : counts)
        result.filled += c.filled, result.unfilled += c.unfilled;
    result.completed = true;
    return result;
}

}  // namespace processes
}  // namespace kestrel
