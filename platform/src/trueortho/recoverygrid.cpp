// Occlusion recovery's inputs: scene windows on the mosaic grid, their spatial index, and the
// reading of one scene over a rectangle (seen pixels, the pixel-error test, viewing angles).
#include "recoverygrid.h"

#include <kestrel/exception.h>

#include <gdal_priv.h>

#include <algorithm>
#include <cmath>
#include <cstring>

namespace kestrel {
namespace processes {
namespace trueortho {

namespace {

// Grids share a lattice when their pixel sizes agree to this share of a pixel per pixel and
// their origins lie this share of a pixel from a whole number of pixels apart.
constexpr double kSizeTolerance = 1e-7;
constexpr double kOriginTolerance = 1e-3;

// Whole pixels (dx, dy) from grid `ref`'s origin to grid gt's, or false when gt is not on ref's
// lattice.
bool LatticeOffset(const std::array<double, 6>& ref, const std::array<double, 6>& gt, int& dx,
                   int& dy) {
    const double pixel = std::max(std::fabs(ref[1]) + std::fabs(ref[2]), 1e-12);
    for (int k : {1, 2, 4, 5})
        if (!(std::fabs(gt[k] - ref[k]) <= kSizeTolerance * pixel))
            return false;
    const double det = ref[1] * ref[5] - ref[2] * ref[4];
    if (!(std::fabs(det) > 0))
        return false;
    const double ex = gt[0] - ref[0], ey = gt[3] - ref[3];
    const double p = (ref[5] * ex - ref[2] * ey) / det, l = (-ref[4] * ex + ref[1] * ey) / det;
    if (!(std::fabs(p) < 1e9 && std::fabs(l) < 1e9))
        return false;
    dx = static_cast<int>(std::lround(p)), dy = static_cast<int>(std::lround(l));
    return std::fabs(p - dx) <= kOriginTolerance && std::fabs(l - dy) <= kOriginTolerance;
}

std::string Describe(const std::array<double, 6>& gt) {
    return FormatString("origin %.6f, %.6f, pixel %.9g x %.9g", gt[0], gt[3], gt[1], gt[5]);
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

// The viewing angles of a scene over a rectangle, interpolated from a lattice; only in the
// cells that `cells` flags (all when it is null), the rest unknown.
void Angles(const RecoveryJob& job, const RecoveryGrid& grid, const RecoveryScene& scene,
            const ogc::cs::CoordinateTransformation* toModel, const Rect& r,
            const std::vector<unsigned char>* cells, std::vector<float>& out) {
    out.assign(r.Size(), kUnknownAngle);
    if (scene.model == nullptr || job.surface == nullptr)
        return;
    const int tw = r.width, th = r.height;
    const int cx = AngleCells(tw), cy = AngleCells(th);
    const int nx = cx + 1, ny = cy + 1;
    const auto flagged = [&](int a, int b) {
        return cells == nullptr || (*cells)[static_cast<size_t>(b) * cx + a] != 0;
    };
    // A node is needed by the (up to four) cells it is a corner of.
    const auto needed = [&](int a, int b) {
        for (int bb = std::max(0, b - 1); bb <= std::min(cy - 1, b); ++bb)
            for (int aa = std::max(0, a - 1); aa <= std::min(cx - 1, a); ++aa)
                if (flagged(aa, bb))
                    return true;
        return false;
    };
    std::vector<float> lattice(static_cast<size_t>(nx) * ny, kUnknownAngle);
    const auto& g = grid.geoTransform;
    for (int b = 0; b < ny; ++b)
        for (int a = 0; a < nx; ++a) {
            if (!needed(a, b))
                continue;
            const double p = r.x + std::min(a * kAngleStep, tw - 1) + 0.5;
            const double l = r.y + std::min(b * kAngleStep, th - 1) + 0.5;
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
    std::vector<int> nodes(tw);  // per column, its cell
    std::vector<double> fractions(tw);
    for (int i = 0; i < tw; ++i)
        cell(i, tw, nodes[i], fractions[i]);
    // Per column, along the lattice rows above and below the current line (unknown where a
    // node of the cell is, or the cell is not flagged).
    std::vector<double> above(tw), below(tw);
    std::vector<unsigned char> unknown(tw);
    int row = -1, lo = 0, hi = 0;  // the columns of the flagged cells of the cell row
    for (int j = 0; j < th; ++j) {
        int b;
        double fy;
        cell(j, th, b, fy);
        if (b != row) {
            row = b;
            lo = tw, hi = 0;
            for (int a = 0; a < cx; ++a)
                if (flagged(a, b))
                    lo = std::min(lo, a * kAngleStep), hi = std::min(tw, (a + 1) * kAngleStep);
            for (int i = lo; i < hi; ++i) {
                const double fx = fractions[i];
                const size_t k = static_cast<size_t>(b) * nx + nodes[i];
                const float q[4] = {lattice[k], lattice[k + 1], lattice[k + nx], lattice[k + nx + 1]};
                unknown[i] = !flagged(nodes[i], b) || std::isinf(q[0]) || std::isinf(q[1]) ||
                             std::isinf(q[2]) || std::isinf(q[3]);
                above[i] = (1 - fx) * q[0] + fx * q[1];
                below[i] = (1 - fx) * q[2] + fx * q[3];
            }
        }
        float* line = out.data() + static_cast<size_t>(j) * tw;
        for (int i = lo; i < hi; ++i)
            if (!unknown[i])
                line[i] = static_cast<float>((1 - fy) * above[i] + fy * below[i]);
    }
}

// Sizes a buffer of `planes` planes over r for a raster lying at `window`, filled with `outside`
// only where the raster does not cover r (the read overwrites the rest).
template <typename T>
void Prepare(std::vector<T>& buffer, const Rect& r, const Rect& window, int planes, T outside) {
    const std::size_t size = r.Size() * static_cast<std::size_t>(planes);
    if (r.Intersect(window).Size() == r.Size())
        buffer.resize(size);
    else
        buffer.assign(size, outside);
}

}  // namespace

Rect Rect::Intersect(const Rect& o) const {
    const int x0 = std::max(x, o.x), y0 = std::max(y, o.y);
    const int x1 = std::min(x + width, o.x + o.width), y1 = std::min(y + height, o.y + o.height);
    return {x0, y0, std::max(0, x1 - x0), std::max(0, y1 - y0)};
}

Rect Rect::Union(const Rect& o) const {
    if (o.Empty())
        return *this;
    if (Empty())
        return o;
    const int x0 = std::min(x, o.x), y0 = std::min(y, o.y);
    return {x0, y0, std::max(x + width, o.x + o.width) - x0,
            std::max(y + height, o.y + o.height) - y0};
}

void SharedRaster::Read(const int* bands, int count, const Rect& r, GDALDataType bufferType,
                        void* buffer) {
    if (r.Intersect(window).Empty())
        return;
    std::lock_guard<std::mutex> lock(mutex);
    if (!dataset) {
        dataset = OpenRaster(path, role);
        if (dataset->GetRasterXSize() != window.width || dataset->GetRasterYSize() != window.height)
            KESTREL_THROW(DataException,
                          FormatString("Occlusion recovery: the %s %s changed during the run "
                                       "(%d x %d pixels, was %d x %d)",
                                       role, path.c_str(), dataset->GetRasterXSize(),
                                       dataset->GetRasterYSize(), window.width, window.height));
    }
    if (pool != nullptr)
        pool->Touch(*this);
    ReadWindow(*dataset, path, bands, count, r.x - window.x, r.y - window.y, r.width, r.height,
               bufferType, buffer);
}

void RasterPool::Touch(SharedRaster& raster) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (raster.listed_)
        order_.splice(order_.begin(), order_, raster.place_);
    else
        order_.push_front(&raster), raster.listed_ = true, raster.place_ = order_.begin();
    // Close the least recently read rasters that no thread holds (never waiting for one).
    for (auto it = std::prev(order_.end()); order_.size() > capacity_ && it != order_.begin();) {
        SharedRaster& old = **it;
        const auto previous = std::prev(it);
        std::unique_lock<std::mutex> held(old.mutex, std::try_to_lock);
        if (held.owns_lock()) {
            old.dataset.reset();
            old.listed_ = false;
            order_.erase(it);
        }
        it = previous;
    }
}

void RasterPool::CloseAll() {
    std::lock_guard<std::mutex> lock(mutex_);
    for (SharedRaster* raster : order_) {
        std::lock_guard<std::mutex> held(raster->mutex);
        raster->dataset.reset();
        raster->listed_ = false;
    }
    order_.clear();
}

std::vector<std::size_t> RecoveryGrid::ScenesMeeting(const Rect& r) const {
    const Rect in = r.Intersect(Whole());
    std::vector<std::size_t> scenes;
    if (in.Empty())
        return scenes;
    const int bx0 = in.x / kBucket, bx1 = (in.x + in.width - 1) / kBucket;
    const int by0 = in.y / kBucket, by1 = (in.y + in.height - 1) / kBucket;
    for (int by = by0; by <= by1; ++by)
        for (int bx = bx0; bx <= bx1; ++bx)
            for (const std::uint32_t s : buckets[static_cast<size_t>(by) * bucketsX + bx])
                if (!windows[s].Intersect(in).Empty())
                    scenes.push_back(s);
    std::sort(scenes.begin(), scenes.end());
    scenes.erase(std::unique(scenes.begin(), scenes.end()), scenes.end());
    return scenes;
}

std::unique_ptr<SharedRaster> RecoveryGrid::OpenOnGrid(const std::string& path,
                                                       const char* role) const {
    auto raster = std::make_unique<SharedRaster>();
    raster->dataset = OpenRaster(path, role);
    raster->path = path;
    raster->role = role;
    raster->window = {0, 0, raster->dataset->GetRasterXSize(), raster->dataset->GetRasterYSize()};
    std::array<double, 6> gt{};
    if (raster->dataset->GetGeoTransform(gt.data()) == CE_None &&
        !LatticeOffset(geoTransform, gt, raster->window.x, raster->window.y))
        KESTREL_THROW(DataException,
                      FormatString("Occlusion recovery: the %s %s (%s) is not on the mosaic's "
                                   "grid (%s)",
                                   role, path.c_str(), Describe(gt).c_str(),
                                   Describe(geoTransform).c_str()));
    return raster;
}

RecoveryGrid InspectScenes(const RecoveryJob& job) {
    if (job.scenes.empty())
        KESTREL_THROW(DataException, "Occlusion recovery: no scenes given");
    if ((job.pixels == 0) != (job.lines == 0))
        KESTREL_THROW(DataException,
                      FormatString("Occlusion recovery: a mosaic grid of %u x %u pixels; give "
                                   "both sizes, or neither for the union of the scenes",
                                   job.pixels, job.lines));
    RecoveryGrid grid;
    std::array<double, 6> lattice{};  // the first scene's grid
    std::vector<Rect> raw;            // windows relative to the first scene
    for (size_t s = 0; s < job.scenes.size(); ++s) {
        const RecoveryScene& scene = job.scenes[s];
        if (scene.dbmPixelError < 0 || scene.dbmPixelError > 1000)
            KESTREL_THROW(DataException,
                          FormatString("Occlusion recovery: scene %zu (%s) has DBM pixel error "
                                       "%d; expected 0 to 1000",
                                       s + 1, scene.orthoPath.c_str(), scene.dbmPixelError));
        grid.halo = std::max(grid.halo, scene.dbmPixelError);
        grid.orthos.push_back(std::make_unique<SharedRaster>());
        grid.visibilities.push_back(std::make_unique<SharedRaster>());
        SharedRaster& orthoFile = *grid.orthos.back();
        SharedRaster& visibilityFile = *grid.visibilities.back();
        orthoFile.path = scene.orthoPath, visibilityFile.path = scene.visibilityPath;
        orthoFile.role = "ortho", visibilityFile.role = "visibility index";
        orthoFile.pool = visibilityFile.pool = grid.pool.get();
        orthoFile.dataset = OpenRaster(scene.orthoPath, orthoFile.role);
        visibilityFile.dataset = OpenRaster(scene.visibilityPath, visibilityFile.role);
        GDALDataset& ortho = *orthoFile.dataset;
        GDALDataset& visibility = *visibilityFile.dataset;
        std::array<double, 6> gt{};
        const bool georeferenced = ortho.GetGeoTransform(gt.data()) == CE_None;
        GDALRasterBand* first = ortho.GetRasterBand(1);
        if (!georeferenced || first == nullptr)
            KESTREL_THROW(DataException,
                          FormatString("Occlusion recovery: %s has no %s", scene.orthoPath.c_str(),
                                       georeferenced ? "channels" : "georeferencing"));
        const int pixels = ortho.GetRasterXSize(), lines = ortho.GetRasterYSize();
        const OGRSpatialReference* srs = ortho.GetSpatialRef();
        Rect window{0, 0, pixels, lines};
        if (s == 0) {
            lattice = gt;
            grid.bands = ortho.GetRasterCount();
            grid.type = first->GetRasterDataType();
            if (srs != nullptr)
                grid.crs = std::make_unique<ogc::cs::ICRS>(*srs);
            int has = 0;
            grid.noData = first->GetNoDataValue(&has);
            grid.hasNoData = has != 0;
        } else {
            const std::string& firstPath = job.scenes[0].orthoPath;
            const bool sameCrs = (srs == nullptr) == !grid.crs &&
                                 (srs == nullptr || grid.crs->IsSame(ogc::cs::ICRS(*srs)));
            if (!sameCrs)
                KESTREL_THROW(DataException,
                              FormatString("Occlusion recovery: %s is not in the CRS of %s; the "
                                           "orthos of one image set share one CRS",
                                           scene.orthoPath.c_str(), firstPath.c_str()));
            if (!LatticeOffset(lattice, gt, window.x, window.y))
                KESTREL_THROW(DataException,
                              FormatString("Occlusion recovery: %s (%s) is not on the grid of "
                                           "%s (%s); the orthos of one image set share one "
                                           "pixel size, with origins a whole number of pixels "
                                           "apart",
                                           scene.orthoPath.c_str(), Describe(gt).c_str(),
                                           firstPath.c_str(), Describe(lattice).c_str()));
            if (ortho.GetRasterCount() != grid.bands || first->GetRasterDataType() != grid.type)
                KESTREL_THROW(DataException,
                              FormatString("Occlusion recovery: %s has %d channels of %s, but %s "
                                           "has %d of %s",
                                           scene.orthoPath.c_str(), ortho.GetRasterCount(),
                                           GDALGetDataTypeName(first->GetRasterDataType()),
                                           firstPath.c_str(), grid.bands,
                                           GDALGetDataTypeName(grid.type)));
        }
        if (visibility.GetRasterXSize() != pixels || visibility.GetRasterYSize() != lines)
            KESTREL_THROW(
                DataException,
                FormatString("Occlusion recovery: the visibility index %s (%d x %d) "
                             "does not match its ortho %s (%d x %d)",
                             scene.visibilityPath.c_str(), visibility.GetRasterXSize(),
                             visibility.GetRasterYSize(), scene.orthoPath.c_str(), pixels, lines));
        if (GDALRasterBand* band = visibility.GetRasterBand(1))
            visibilityFile.type = band->GetRasterDataType();
        orthoFile.type = GDT_Byte;  // when every band is
        for (int b = 1; b <= ortho.GetRasterCount(); ++b)
            if (ortho.GetRasterBand(b)->GetRasterDataType() != GDT_Byte)
                orthoFile.type = GDT_Float32;
        raw.push_back(window);
        // Opened again when read.
        orthoFile.dataset.reset(), visibilityFile.dataset.reset();
    }

    // The mosaic grid: the job's, on the scenes' lattice, or the union of their windows.
    int mx = 0, my = 0;
    if (job.pixels > 0) {
        const std::array<double, 6>& gt = job.geocoding.GetGeoTransform();
        if (!LatticeOffset(lattice, gt, mx, my))
            KESTREL_THROW(DataException,
                          FormatString("Occlusion recovery: the mosaic grid (%s) is not on the "
                                       "grid of the orthos (%s of %s)",
                                       Describe(gt).c_str(), Describe(lattice).c_str(),
                                       job.scenes[0].orthoPath.c_str()));
        grid.geoTransform = gt;
        grid.pixels = job.pixels, grid.lines = job.lines;
    } else {
        long long x0 = raw[0].x, y0 = raw[0].y, x1 = x0 + raw[0].width, y1 = y0 + raw[0].height;
        for (const Rect& w : raw) {
            x0 = std::min<long long>(x0, w.x), y0 = std::min<long long>(y0, w.y);
            x1 = std::max<long long>(x1, w.x + w.width), y1 = std::max<long long>(y1, w.y + w.height);
        }
        if (x1 - x0 > 4000000000LL || y1 - y0 > 4000000000LL)
            KESTREL_THROW(DataException, "Occlusion recovery: the scenes span a grid of more "
                                         "than 4e9 pixels across");
        mx = static_cast<int>(x0), my = static_cast<int>(y0);
        grid.geoTransform = lattice;
        grid.geoTransform[0] = lattice[0] + mx * lattice[1] + my * lattice[2];
        grid.geoTransform[3] = lattice[3] + mx * lattice[4] + my * lattice[5];
        grid.pixels = static_cast<unsigned int>(x1 - x0);
        grid.lines = static_cast<unsigned int>(y1 - y0);
    }
    for (size_t s = 0; s < raw.size(); ++s) {
        Rect w = raw[s];
        w.x -= mx, w.y -= my;
        grid.orthos[s]->window = grid.visibilities[s]->window = w;
        grid.windows.push_back(w.Intersect(grid.Whole()));
    }

    grid.bucketsX = static_cast<int>((grid.pixels + RecoveryGrid::kBucket - 1) / RecoveryGrid::kBucket);
    grid.bucketsY = static_cast<int>((grid.lines + RecoveryGrid::kBucket - 1) / RecoveryGrid::kBucket);
    grid.buckets.resize(static_cast<size_t>(grid.bucketsX) * grid.bucketsY);
    for (size_t s = 0; s < grid.windows.size(); ++s) {
        const Rect& w = grid.windows[s];
        if (w.Empty())
            continue;
        for (int by = w.y / RecoveryGrid::kBucket; by <= (w.y + w.height - 1) / RecoveryGrid::kBucket; ++by)
            for (int bx = w.x / RecoveryGrid::kBucket; bx <= (w.x + w.width - 1) / RecoveryGrid::kBucket; ++bx)
                grid.buckets[static_cast<size_t>(by) * grid.bucketsX + bx].push_back(
                    static_cast<std::uint32_t>(s));
    }
    return grid;
}

SceneReader::SceneReader(const RecoveryJob& job, const RecoveryGrid& grid)
    : job_(job), grid_(grid), bands_(grid.bands) {
    for (int b = 0; b < grid.bands; ++b)
        bands_[b] = b + 1;
    toModel_.resize(job.scenes.size());
    for (size_t s = 0; s < job.scenes.size(); ++s) {
        const mathmodel::IMathModel* model = job.scenes[s].model;
        if (model != nullptr && model->GetCRS() != nullptr && grid.crs &&
            !model->GetCRS()->IsSame(*grid.crs))
            toModel_[s] =
                std::make_unique<ogc::cs::CoordinateTransformation>(*grid.crs, *model->GetCRS());
    }
}

bool SceneReader::ReadVisibility(std::size_t s, const Rect& r, Scratch& scratch,
                                 std::vector<unsigned char>& vis) const {
    const int e = job_.scenes[s].dbmPixelError;
    const Rect border = r.Grown(e);
    SharedRaster& file = *grid_.visibilities[s];
    const unsigned char outside = VISIBILITY_OUTSIDE;
    Prepare(vis, border, file.window, 1, outside);
    if (file.type == GDT_Byte) {
        file.Read(&SharedRaster::kFirstBand, 1, border, GDT_Byte, vis.data());
    } else {
        // Any other type: the values that are exactly seen or hidden, the rest outside.
        Prepare(scratch.values, border, file.window, 1, static_cast<float>(outside));
        file.Read(border, scratch.values.data());
        for (size_t k = 0; k < vis.size(); ++k) {
            const float v = scratch.values[k];
            vis[k] = static_cast<unsigned char>(v == VISIBILITY_SEEN     ? VISIBILITY_SEEN
                                                : v == VISIBILITY_HIDDEN ? VISIBILITY_HIDDEN
                                                                         : VISIBILITY_OUTSIDE);
        }
    }
    for (int j = 0; j < r.height; ++j)
        if (std::memchr(vis.data() + static_cast<size_t>(j + e) * border.width + e,
                        VISIBILITY_SEEN, static_cast<size_t>(r.width)) != nullptr)
            return true;
    return false;
}

bool SceneReader::ReadBytes(std::size_t s, const Rect& r, std::vector<unsigned char>& bytes) const {
    if (grid_.orthos[s]->type != GDT_Byte)
        return false;
    bytes.resize(r.Size() * grid_.bands);
    grid_.orthos[s]->Read(bands_.data(), grid_.bands, r, GDT_Byte, bytes.data());
    return true;
}

bool SceneReader::Read(std::size_t s, const Rect& r, bool values, bool angles, Scratch& scratch,
                       SceneTile& out) const {
    const int e = job_.scenes[s].dbmPixelError;
    std::vector<unsigned char>& vis = scratch.visibility;
    out.scene = s;
    if (!ReadVisibility(s, r, scratch, vis))
        return false;
    PixelStates(vis.data(), r.width, r.height, e, scratch, out.state);
    if (values)
        ReadValues(s, r, out.values);
    if (angles) {
        const int across = AngleCells(r.width);
        scratch.cells.assign(static_cast<size_t>(across) * AngleCells(r.height), 0);
        for (int j = 0; j < r.height; ++j) {
            const unsigned char* state = out.state.data() + static_cast<size_t>(j) * r.width;
            unsigned char* cells = scratch.cells.data() + static_cast<size_t>(j / kAngleStep) * across;
            for (int i = 0; i < r.width; ++i)
                cells[i / kAngleStep] |= state[i] != kNotSeen;
        }
        ReadAngles(r, scratch, out, &scratch.cells);
    }
    return true;
}

void SceneReader::ReadAngles(const Rect& r, Scratch& scratch, SceneTile& out,
                             const std::vector<unsigned char>* cells) const {
    const std::size_t s = out.scene;
    scratch.toModel.resize(toModel_.size());
    if (toModel_[s] && !scratch.toModel[s])
        scratch.toModel[s] = std::make_unique<ogc::cs::CoordinateTransformation>(*toModel_[s]);
    Angles(job_, grid_, job_.scenes[s], scratch.toModel[s].get(), r, cells, out.angle);
}

void SceneReader::ReadBalanced(std::size_t s, const Rect& r, const Rect& part,
                               const std::vector<double>& gain, const std::vector<double>& offset,
                               const std::vector<unsigned char>& state, const ValueRange& range,
                               Scratch& scratch, std::vector<float>& values) const {
    const size_t size = r.Size();
    if (grid_.orthos[s]->type != GDT_Byte) {
        ReadValues(s, r, values);
        for (int b = 0; b < grid_.bands; ++b) {
            if (gain[b] == 1 && offset[b] == 0)
                continue;
            float* v = values.data() + size * b;
            for (size_t p = 0; p < size; ++p)
                if (state[p] != kNotSeen)
                    v[p] = range(gain[b] * v[p] + offset[b]);
        }
        return;
    }
    // Byte values: read as they are, each band's 256 values balanced once, and both taken to
    // Float32 in one pass over the part on the scene's raster (no-data in the rest of the part).
    const Rect on = part.Intersect(grid_.orthos[s]->window);
    values.resize(size * grid_.bands);
    if (on.Size() != part.Size())
        for (int b = 0; b < grid_.bands; ++b)
            for (int j = part.y - r.y; j < part.y - r.y + part.height; ++j)
                std::fill_n(values.data() + size * b + static_cast<size_t>(j) * r.width +
                                (part.x - r.x),
                            part.width, static_cast<float>(grid_.noData));
    if (on.Empty())
        return;
    ReadBytes(s, on, scratch.bytes);
    float table[256], plain[256];
    for (int value = 0; value < 256; ++value)
        plain[value] = static_cast<float>(value);
    for (int b = 0; b < grid_.bands; ++b) {
        range.BalancedBytes(gain[b], offset[b], table);
        for (int j = 0; j < on.height; ++j) {
            const size_t first = static_cast<size_t>(on.y - r.y + j) * r.width + (on.x - r.x);
            const unsigned char* in =
                scratch.bytes.data() + on.Size() * b + static_cast<size_t>(j) * on.width;
            const unsigned char* seen = state.data() + first;
            float* out = values.data() + size * b + first;
            for (int i = 0; i < on.width; ++i)
                out[i] = seen[i] != kNotSeen ? table[in[i]] : plain[in[i]];
        }
    }
}

void SceneReader::ReadValues(std::size_t s, const Rect& r, std::vector<float>& values) const {
    Prepare(values, r, grid_.orthos[s]->window, grid_.bands, static_cast<float>(grid_.noData));
    grid_.orthos[s]->Read(bands_.data(), grid_.bands, r, GDT_Float32, values.data());
}

bool SeenClearly(const unsigned char* vis, int width, int e, int i, int j) {
    if (vis[static_cast<size_t>(j + e) * width + i + e] != VISIBILITY_SEEN)
        return false;
    for (int row = j; row <= j + 2 * e; ++row)
        if (std::memchr(vis + static_cast<size_t>(row) * width + i, VISIBILITY_HIDDEN,
                        static_cast<size_t>(2 * e + 1)) != nullptr)
            return false;
    return true;
}

// The square neighbourhood of hidden pixels is a dilation along each row, then down each
// column. Along a row, each hidden pixel marks the 2e + 1 outputs that reach it, each output
// written once; down the columns, each output looks at the last row that marked its column.
// Rows and windows without a hidden pixel cost a scan for one.
void PixelStates(const unsigned char* vis, int tw, int th, int e, SceneReader::Scratch& scratch,
                 std::vector<unsigned char>& state) {
    const int vw = tw + 2 * e, vh = th + 2 * e;
    state.resize(static_cast<size_t>(tw) * th);
    const bool anyHidden =
        std::memchr(vis, VISIBILITY_HIDDEN, static_cast<size_t>(vw) * vh) != nullptr;
    std::vector<unsigned char>& row = scratch.row;  // the marks of one border row
    std::vector<int>& last = scratch.last;          // per column, the last border row marking it
    row.resize(tw);
    last.assign(tw, -1);
    int latest = -1;  // the last border row marking any column
    for (int r = anyHidden ? 0 : 2 * e; r < vh; ++r) {
        const unsigned char* line = vis + static_cast<size_t>(r) * vw;
        const void* hidden =
            anyHidden ? std::memchr(line, VISIBILITY_HIDDEN, static_cast<size_t>(vw)) : nullptr;
        if (hidden != nullptr) {
            std::fill(row.begin(), row.end(), 0);
            int filled = 0;  // marks before this one are written
            for (const unsigned char* p = static_cast<const unsigned char*>(hidden); p != nullptr;
                 p = static_cast<const unsigned char*>(std::memchr(
                     p + 1, VISIBILITY_HIDDEN, static_cast<size_t>(line + vw - p - 1)))) {
                const int c = static_cast<int>(p - line);
                const int lo = std::max(filled, c - 2 * e), hi = std::min(tw, c + 1);
                if (hi > lo)
                    std::fill(row.begin() + lo, row.begin() + hi, 1), filled = hi;
            }
            for (int i = 0; i < tw; ++i)
                last[i] = row[i] ? r : last[i];
            latest = r;
        }
        const int j = r - 2 * e;  // the output line whose neighbourhood ends here
        if (j < 0)
            continue;
        const unsigned char* seen = vis + static_cast<size_t>(j + e) * vw + e;
        unsigned char* out = state.data() + static_cast<size_t>(j) * tw;
        if (latest < j)
            for (int i = 0; i < tw; ++i)
                out[i] = seen[i] == VISIBILITY_SEEN ? kClear : kNotSeen;
        else
            for (int i = 0; i < tw; ++i)
                out[i] = seen[i] != VISIBILITY_SEEN ? kNotSeen : last[i] >= j ? kUnclear : kClear;
    }
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
