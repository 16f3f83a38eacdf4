// Occlusion recovery: the true-ortho mosaic of several orthos on one grid, each pixel taken
// from the scene that sees it best.
#include <kestrel/exception.h>
#include <kestrel/trueortho.h>

#include "../gdalsupport.h"
#include "rasterfiles.h"
#include "runcontrol.h"

#include <gdal_priv.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <limits>

namespace kestrel {
namespace processes {

using trueortho::DatasetPtr;
using trueortho::OutputRaster;
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

struct Grid {
    unsigned int pixels = 0, lines = 0;
    int bands = 0;
    GDALDataType type = GDT_Unknown;
    std::array<double, 6> geoTransform{};
    std::unique_ptr<ogc::cs::ICRS> crs;
    std::vector<SceneInfo> scenes;
    int halo = 0;  // the largest pixel error
};

struct Worker {
    std::vector<DatasetPtr> orthos, visibilities;
    std::vector<std::unique_ptr<ogc::cs::CoordinateTransformation>> toModel;
    std::vector<std::vector<float>> values, visibility, angle;
    std::vector<float> mosaic, source;
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

// Opens every scene once and checks that they share one grid, data type and channel count.
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
        DatasetPtr ortho = trueortho::OpenRaster(scene.orthoPath, "ortho");
        DatasetPtr visibility = trueortho::OpenRaster(scene.visibilityPath, "visibility index");
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

// The choice for one pixel among the scenes that see it. Lower ranks first:
//   1. seen clearly: no hidden pixel of the scene within its DBM pixel error (the visibility
//      test's tolerance), so an error of the surface model cannot have put the pixel on the
//      wrong side of an occlusion edge;
//   2. the lower radiometric difference level;
//   3. the line of sight nearer the vertical (a known angle before an unknown one);
//   4. the scene listed first.
struct Rank {
    int unclear, level;
    float angle;
    size_t index;
    bool operator<(const Rank& o) const {
        if (unclear != o.unclear)
            return unclear < o.unclear;
        if (level != o.level)
            return level < o.level;
        if (angle != o.angle)
            return angle < o.angle;
        return index < o.index;
    }
};

void ProcessTile(const RecoveryJob& job, const Grid& grid, Worker& w, OutputRaster& mosaic,
                 OutputRaster& source, int tx, int ty, int tw, int th, const RunControl& control,
                 TorthoRecoveryResult& counts) {
    const size_t scenes = job.scenes.size();
    const int halo = grid.halo;
    // Visibility with a border of the largest pixel error around the tile.
    const int vx = tx - halo, vy = ty - halo, vw = tw + 2 * halo, vh = th + 2 * halo;
    const size_t tileSize = static_cast<size_t>(tw) * th;
    w.values.resize(scenes), w.visibility.resize(scenes), w.angle.resize(scenes);
    std::vector<int> allBands(grid.bands);
    for (int b = 0; b < grid.bands; ++b)
        allBands[b] = b + 1;
    for (size_t s = 0; s < scenes; ++s) {
        if (control.Stopped())
            return;
        w.visibility[s].assign(static_cast<size_t>(vw) * vh, VISIBILITY_OUTSIDE);
        trueortho::ReadWindow(*w.visibilities[s], job.scenes[s].visibilityPath, {1}, vx, vy, vw, vh,
                              w.visibility[s].data());
        w.values[s].assign(tileSize * grid.bands, 0.0f);
        trueortho::ReadWindow(*w.orthos[s], job.scenes[s].orthoPath, allBands, tx, ty, tw, th,
                              w.values[s].data());
        Angles(job, grid, job.scenes[s], w.toModel[s].get(), tx, ty, tw, th, w.angle[s]);
    }
    const SceneInfo& first = grid.scenes[0];
    w.mosaic.assign(tileSize * grid.bands, static_cast<float>(first.hasNoData ? first.noData : 0));
    w.source.assign(tileSize, 0.0f);
    for (int j = 0; j < th; ++j) {
        if ((j & 15) == 0 && control.Stopped())
            return;
        for (int i = 0; i < tw; ++i) {
            const size_t o = static_cast<size_t>(j) * tw + i;
            bool found = false;
            Rank best{};
            for (size_t s = 0; s < scenes; ++s) {
                const std::vector<float>& vis = w.visibility[s];
                auto visAt = [&](int di, int dj) {
                    return vis[static_cast<size_t>(j + halo + dj) * vw + (i + halo + di)];
                };
                if (visAt(0, 0) != VISIBILITY_SEEN)
                    continue;
                const int e = job.scenes[s].dbmPixelError;
                int unclear = 0;
                for (int dj = -e; dj <= e && !unclear; ++dj)
                    for (int di = -e; di <= e && !unclear; ++di)
                        unclear = visAt(di, dj) == VISIBILITY_HIDDEN;
                const Rank rank{unclear, job.scenes[s].radiometricLevel, w.angle[s][o], s};
                if (!found || rank < best)
                    best = rank, found = true;
            }
            if (!found) {
                ++counts.unfilled;
                continue;
            }
            ++counts.filled;
            w.source[o] = static_cast<float>(best.index + 1);
            for (int b = 0; b < grid.bands; ++b)
                w.mosaic[tileSize * b + o] = w.values[best.index][tileSize * b + o];
        }
    }
    mosaic.Write(tx, ty, tw, th, w.mosaic.data());
    source.Write(tx, ty, tw, th, w.source.data());
}

}  // namespace

TorthoRecoveryResult OcclusionRecovery::Recover(const RecoveryJob& job) {
    RunControl control(CancelFlag(), Progress(), ProgressData());
    const Grid grid = Inspect(job);
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

    const ogc::cs::GeocodingInfo geocoding(grid.geoTransform);
    const SceneInfo& first = grid.scenes[0];
    OutputRaster mosaic(job.mosaicPath, job.format, grid.pixels, grid.lines, grid.bands, grid.type,
                        grid.crs.get(), geocoding, first.hasNoData ? first.noData : 0.0);
    OutputRaster source(job.sourcePath, job.format, grid.pixels, grid.lines, 1,
                        job.scenes.size() < 255 ? GDT_Byte : GDT_UInt16, grid.crs.get(), geocoding,
                        0.0);

    const unsigned int tile = job.tileSize;
    const unsigned int tilesX = (grid.pixels + tile - 1) / tile;
    const unsigned int tilesY = (grid.lines + tile - 1) / tile;
    std::vector<TorthoRecoveryResult> counts(ThreadsToUse());
    std::vector<std::unique_ptr<Worker>> workers(counts.size());
    control.RunTiles(
        static_cast<size_t>(tilesX) * tilesY, static_cast<unsigned int>(counts.size()),
        "Occlusion recovery", [&](unsigned int thread, size_t index) {
            std::unique_ptr<Worker>& w = workers[thread];
            if (!w) {
                w = std::make_unique<Worker>();
                for (size_t s = 0; s < job.scenes.size(); ++s) {
                    w->orthos.push_back(trueortho::OpenRaster(job.scenes[s].orthoPath, "ortho"));
                    w->visibilities.push_back(
                        trueortho::OpenRaster(job.scenes[s].visibilityPath, "visibility index"));
                    w->toModel.push_back(
                        toModel[s]
                            ? std::make_unique<ogc::cs::CoordinateTransformation>(*toModel[s])
                            : nullptr);
                }
            }
            const int tx = static_cast<int>((index % tilesX) * tile);
            const int ty = static_cast<int>((index / tilesX) * tile);
            const int tw = static_cast<int>(std::min(tile, grid.pixels - tx));
            const int th = static_cast<int>(std::min(tile, grid.lines - ty));
            ProcessTile(job, grid, *w, mosaic, source, tx, ty, tw, th, control, counts[thread]);
        });
    if (control.Stopped())
        return result;
    mosaic.Commit();
    source.Commit();
    for (const auto& c : counts)
        result.filled += c.filled, result.unfilled += c.unfilled;
    result.completed = true;
    return result;
}

}  // namespace processes
}  // namespace kestrel
