// Occlusion recovery: the true-ortho mosaic of several orthos on windows of one grid. In order:
// the colour balance fitted where scenes overlap, the regions (an edited raster or seamlines
// chosen by the seam solver), then tile by tile the balanced scenes blended across the seams.
#include <kestrel/exception.h>
#include <kestrel/raster.h>
#include <kestrel/rasterio.h>
#include <kestrel/trueortho.h>

#include "../datasources/gdaldataset.h"
#include "blend.h"
#include "recoverygrid.h"
#include "runcontrol.h"

#include <gdal_priv.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <filesystem>
#include <limits>

namespace kestrel {
namespace processes {

using trueortho::Rect;
using trueortho::RecoveryGrid;
using trueortho::RunControl;
using trueortho::SceneReader;
using trueortho::SceneTile;

namespace {

// What every tile of the composition shares.
struct Composition {
    const RecoveryJob& job;
    const RecoveryGrid& grid;
    const SceneReader& reader;
    const trueortho::BalanceFit& fit;
    trueortho::SharedRaster* regions = nullptr;  // labels: 1 + scene, 0 none
    trueortho::SharedRaster* mask = nullptr;
    trueortho::BlendMode blend = trueortho::BlendMode::Feather;
    int border = 0;
    trueortho::ValueRange range;
    datasources::BasicWriter *mosaic = nullptr, *source = nullptr;
    // Every scene and the mosaic are Byte: hard seams go from byte to byte (HardSeamBytes).
    bool bytes = false;
    unsigned char noDataByte = 0;  // the no-data value as the mosaic's Byte band holds it
};

// One thread's buffers, reused from tile to tile.
struct Worker {
    SceneReader::Scratch scratch;
    std::vector<SceneTile> scenes;
    std::vector<int> sceneSlot;  // per job scene: its index among the tile's scenes, or -1
    std::vector<int> slot;       // per tile scene: its index among those holding a region
    std::vector<size_t> named;   // the scenes the regions raster names in the tile
    std::vector<Rect> others;    // the rasters of the other scenes meeting the tile, on it
    std::vector<float> regions, mask, blended;
    std::vector<unsigned char> clear;  // per pixel: some scene of the blend sees it clearly
    // RankPixels': per tile scene, its states, level and the angle cells it needs.
    std::vector<const unsigned char*> states;
    std::vector<int> levels;
    std::vector<std::vector<unsigned char>> cells;
    std::vector<std::array<int, 4>> extents;  // RegionBoxes'
    std::vector<Rect> boxes;  // per scene of the blend, where its values are read
    trueortho::BlendTile blend;
};

// Labels each pixel that `labels` leaves unlabelled (-1) and no mask takes out with the scene
// that ranks first there among the tile's n scenes (-1: none sees it). Lower ranks first:
//   1. seen clearly: no hidden pixel of the scene within its DBM pixel error (the visibility
//      test's tolerance), so an error of the surface model cannot have put the pixel on the
//      wrong side of an occlusion edge;
//   2. the lower radiometric difference level;
//   3. the line of sight nearer the vertical (a known angle before an unknown one);
//   4. the scene listed first (scenes are in job order).
// The angles are read only for the scenes tied on the first two, in the lattice cells of the
// tied pixels.
void RankPixels(const RecoveryJob& job, const SceneReader& reader, const Rect& r, size_t n,
                const std::vector<float>* mask, Worker& w, std::vector<int>& labels) {
    constexpr int kTied = -2;
    const int across = trueortho::AngleCells(r.width);
    const size_t cells = static_cast<size_t>(across) * trueortho::AngleCells(r.height);
    w.states.resize(n);
    w.levels.resize(n);
    if (w.cells.size() < n)
        w.cells.resize(n);
    for (size_t k = 0; k < n; ++k) {
        w.states[k] = w.scenes[k].state.data();
        w.levels[k] = job.scenes[w.scenes[k].scene].radiometricLevel;
        w.cells[k].assign(cells, 0);
    }
    const unsigned char* const* states = w.states.data();
    const int* levels = w.levels.data();
    // The best state and level at p, and how many scenes have them; first: the first of them.
    const auto best = [&](size_t p, unsigned char& state, int& level, int& first) {
        int count = 0;
        first = -1;
        for (size_t k = 0; k < n; ++k) {
            const unsigned char s = states[k][p];
            if (s == trueortho::kNotSeen)
                continue;
            if (first < 0 || s < state || (s == state && levels[k] < level))
                first = static_cast<int>(k), state = s, level = levels[k], count = 1;
            else if (s == state && levels[k] == level)
                ++count;
        }
        return count;
    };
    bool tied = false;
    for (int j = 0; j < r.height; ++j)
        for (int i = 0; i < r.width; ++i) {
            const size_t p = static_cast<size_t>(j) * r.width + i;
            if (labels[p] >= 0 || (mask != nullptr && (*mask)[p] == 0))
                continue;
            unsigned char state = 0;
            int level = 0, first;
            if (best(p, state, level, first) < 2) {
                labels[p] = first;
                continue;
            }
            labels[p] = kTied, tied = true;
            const size_t c = static_cast<size_t>(j / trueortho::kAngleStep) * across +
                             i / trueortho::kAngleStep;
            for (size_t k = 0; k < n; ++k)
                if (states[k][p] == state && levels[k] == level)
                    w.cells[k][c] = 1;
        }
    if (!tied)
        return;
    for (size_t k = 0; k < n; ++k)
        if (std::find(w.cells[k].begin(), w.cells[k].end(), 1) != w.cells[k].end())
            reader.ReadAngles(r, w.scratch, w.scenes[k], &w.cells[k]);
    for (size_t p = 0; p < r.Size(); ++p) {
        if (labels[p] != kTied)
            continue;
        unsigned char state = 0;
        int level = 0, first;
        best(p, state, level, first);
        for (size_t k = static_cast<size_t>(first) + 1; k < n; ++k)
            if (states[k][p] == state && levels[k] == level &&
                w.scenes[k].angle[p] < w.scenes[first].angle[p])
                first = static_cast<int>(k);
        labels[p] = first;
    }
}

// Float32 values as GDAL writes them into a Byte band.
void ToBytes(const float* values, unsigned char* bytes, int count) {
    GDALCopyWords(values, GDT_Float32, sizeof(float), bytes, GDT_Byte, 1, count);
}

// Per label 0 to count - 1: the bounding box (in the labels' coordinates) of its pixels within
// `window` of labels `stride` across; empty where it has none.
void RegionBoxes(const std::vector<int>& labels, int stride, const Rect& window, size_t count,
                 std::vector<std::array<int, 4>>& extents, std::vector<Rect>& boxes) {
    // First and last column and line, found by runs of one label along each line.
    extents.assign(count, {std::numeric_limits<int>::max(), std::numeric_limits<int>::max(), -1, -1});
    for (int j = window.y; j < window.y + window.height; ++j) {
        const int* label = labels.data() + static_cast<size_t>(j) * stride;
        for (int i = window.x, end; i < window.x + window.width; i = end) {
            const int l = label[i];
            for (end = i + 1; end < window.x + window.width && label[end] == l;)
                ++end;
            if (l < 0)
                continue;
            std::array<int, 4>& e = extents[l];
            e = {std::min(e[0], i), std::min(e[1], j), std::max(e[2], end - 1), std::max(e[3], j)};
        }
    }
    boxes.resize(count);
    for (size_t l = 0; l < count; ++l) {
        const std::array<int, 4>& e = extents[l];
        boxes[l] = e[2] < 0 ? Rect{} : Rect{e[0], e[1], e[2] - e[0] + 1, e[3] - e[1] + 1};
    }
}

// The inner tile t of a tile r whose regions (w.blend's labels and scenes) are joined by hard
// seams, when every scene and the mosaic are Byte: each pixel its region's byte through one table
// per scene and band (its balance, the value range, a value beside no-data, as the blend's
// Float32 values reach the file), each scene read only over the box of its pixels in t.
void HardSeamBytes(const Composition& c, Worker& w, const Rect& t, const Rect& r,
                   TorthoRecoveryResult& counts) {
    const int bands = c.grid.bands;
    const std::vector<size_t>& scenes = w.blend.scenes;
    const std::vector<int>& labels = w.blend.labels;
    gobs::Raster mosaic(t.width, t.height, bands, datasources::DataType::Byte,
                        gobs::Raster::Initial::Unset);
    gobs::Raster source(t.width, t.height, 1, datasources::DataType::Float32);
    unsigned char* out = static_cast<unsigned char*>(mosaic.GetData());
    float* from = static_cast<float*>(source.GetData());
    const size_t plane = t.Size();
    for (int j = 0; j < t.height; ++j) {
        const int* label = labels.data() + static_cast<size_t>(j + c.border) * r.width + c.border;
        for (int i = 0; i < t.width; ++i) {
            const size_t o = static_cast<size_t>(j) * t.width + i;
            ++(label[i] < 0 ? counts.unfilled : counts.filled);
            from[o] = label[i] < 0 ? 0.0f : static_cast<float>(scenes[label[i]] + 1);
            if (label[i] < 0)
                for (int b = 0; b < bands; ++b)
                    out[plane * b + o] = c.noDataByte;
        }
    }
    RegionBoxes(labels, r.width, Rect{c.border, c.border, t.width, t.height}, scenes.size(),
                w.extents, w.boxes);
    float values[256];
    unsigned char table[256];
    std::vector<unsigned char>& bytes = w.scratch.bytes;
    for (size_t u = 0; u < scenes.size(); ++u) {
        const Rect& box = w.boxes[u];
        if (box.Empty())
            continue;  // its region lies in the border only
        const size_t s = scenes[u];
        const Rect read{r.x + box.x, r.y + box.y, box.width, box.height};
        c.reader.ReadBytes(s, read, bytes);
        for (int b = 0; b < bands; ++b) {
            c.range.BalancedBytes(c.fit.gain[s][b], c.fit.offset[s][b], values);
            for (float& v : values)
                v = c.range.Besides(c.range(v), c.grid.noData);
            ToBytes(values, table, 256);
            for (int j = 0; j < read.height; ++j) {
                const int* label =
                    labels.data() + static_cast<size_t>(box.y + j) * r.width + box.x;
                const unsigned char* in = bytes.data() + read.Size() * b +
                                          static_cast<size_t>(j) * read.width;
                unsigned char* o = out + plane * b +
                                   static_cast<size_t>(box.y - c.border + j) * t.width + box.x -
                                   c.border;
                for (int i = 0; i < read.width; ++i)
                    if (label[i] == static_cast<int>(u))
                        o[i] = table[in[i]];
            }
        }
    }
    c.mosaic->WriteWindow(mosaic, t.x, t.y);
    c.source->WriteWindow(source, t.x, t.y);
}

// One tile of the mosaic: its scenes read with the blend border, each pixel's region, the
// balance, the blend; then the mosaic and source tiles written.
void Compose(const Composition& c, Worker& w, const Rect& t, const RunControl& control,
             TorthoRecoveryResult& counts) {
    const RecoveryJob& job = c.job;
    const int bands = c.grid.bands;
    const Rect r = t.Grown(c.border);
    const size_t size = r.Size();
    const std::vector<size_t> meeting = c.grid.ScenesMeeting(r);
    size_t n = 0;  // the tile's scenes that see some pixel of it, w.scenes[0] to [n - 1]
    const auto read = [&](size_t s) {
        if (w.scenes.size() <= n)
            w.scenes.emplace_back();
        ++counts.sceneReads;
        n += c.reader.Read(s, r, false, false, w.scratch, w.scenes[n]) ? 1 : 0;
    };
    if (c.mask != nullptr) {
        // Outside the mask (and outside its raster) the pixels stay empty.
        w.mask.assign(size, 0.0f);
        c.mask->Read(r, w.mask.data());
    }

    // Regions: the raster's scene where it sees the pixel, else the first ranked.
    std::vector<int>& labels = w.blend.labels;
    labels.assign(size, -1);
    if (c.regions == nullptr) {
        for (const size_t s : meeting) {
            if (control.Stopped())
                return;
            read(s);
        }
    } else {
        w.regions.assign(size, 0.0f);
        c.regions->Read(r, w.regions.data());
        // The scenes the regions name here (regions are large, so a value is mostly the one
        // before it).
        std::vector<size_t>& named = w.named;
        named.clear();
        float previous = 0;
        for (size_t p = 0; p < size; ++p) {
            const float v = w.regions[p];
            if (v == 0 || v == previous)
                continue;
            if (!(v >= 1 && v <= job.scenes.size() && v == std::floor(v)))
                KESTREL_THROW(DataException,
                              FormatString("Occlusion recovery: the regions raster %s holds %g "
                                           "at pixel %d, line %d; expected 0 or a scene from 1 "
                                           "to %zu",
                                           c.regions->path.c_str(), v,
                                           r.x + static_cast<int>(p % r.width),
                                           r.y + static_cast<int>(p / r.width),
                                           job.scenes.size()));
            previous = v;
            if (std::find(named.begin(), named.end(), static_cast<size_t>(v) - 1) == named.end())
                named.push_back(static_cast<size_t>(v) - 1);
        }
        std::sort(named.begin(), named.end());
        // Set for the tile's scenes only, and reset after, so that a tile costs nothing per
        // scene of the job.
        const auto labelRegions = [&] {
            w.sceneSlot.resize(job.scenes.size(), -1);
            for (size_t k = 0; k < n; ++k)
                w.sceneSlot[w.scenes[k].scene] = static_cast<int>(k);
            for (size_t p = 0; p < size; ++p) {
                const float v = w.regions[p];
                if (v == 0)
                    continue;
                const int k = w.sceneSlot[static_cast<size_t>(v) - 1];
                if (k >= 0 && w.scenes[k].state[p] != trueortho::kNotSeen)
                    labels[p] = k;
            }
            for (size_t k = 0; k < n; ++k)
                w.sceneSlot[w.scenes[k].scene] = -1;
        };
        // The regions' scenes first: the other scenes weigh in only at pixels that no region's
        // scene sees, so they are read only when such a pixel (not masked out) lies on one of
        // their rasters.
        std::vector<Rect>& others = w.others;
        others.clear();
        for (const size_t s : meeting) {
            if (control.Stopped())
                return;
            if (std::binary_search(named.begin(), named.end(), s))
                read(s);
            else
                others.push_back(c.grid.visibilities[s]->window.Intersect(r));
        }
        labelRegions();
        bool needed = false;
        for (const Rect& o : others) {
            for (int j = o.y - r.y; j < o.y - r.y + o.height && !needed; ++j)
                for (int i = o.x - r.x; i < o.x - r.x + o.width && !needed; ++i) {
                    const size_t p = static_cast<size_t>(j) * r.width + i;
                    needed = labels[p] < 0 && (c.mask == nullptr || w.mask[p] != 0);
                }
            if (needed)
                break;
        }
        if (needed) {
            const size_t first = n;
            for (const size_t s : meeting) {
                if (control.Stopped())
                    return;
                if (!std::binary_search(named.begin(), named.end(), s))
                    read(s);
            }
            if (n > first) {
                // Back in the job's order, which breaks ties in the ranking and orders the blend.
                std::sort(w.scenes.begin(), w.scenes.begin() + static_cast<std::ptrdiff_t>(n),
                          [](const SceneTile& a, const SceneTile& b) { return a.scene < b.scene; });
                labels.assign(size, -1);
                labelRegions();
            }
        }
    }
    RankPixels(job, c.reader, r, n, c.mask != nullptr ? &w.mask : nullptr, w, labels);
    if (c.mask != nullptr)
        for (size_t p = 0; p < size; ++p)
            if (w.mask[p] == 0)
                labels[p] = -1;

    // The scenes that hold a region here (the others weigh nothing in the blend): their
    // values, balanced.
    trueortho::BlendTile& blend = w.blend;
    blend.width = r.width, blend.height = r.height, blend.border = c.border, blend.bands = bands;
    blend.x0 = t.x, blend.y0 = t.y;
    w.slot.assign(n, -1);
    for (const int label : labels)
        if (label >= 0)
            w.slot[label] = 0;
    size_t used = 0;
    for (size_t k = 0; k < n; ++k)
        if (w.slot[k] == 0)
            w.slot[k] = static_cast<int>(used++);
    for (int& label : labels)
        if (label >= 0)
            label = w.slot[label];
    blend.scenes.resize(used);
    for (size_t k = 0; k < n; ++k)
        if (w.slot[k] >= 0)
            blend.scenes[static_cast<size_t>(w.slot[k])] = w.scenes[k].scene;
    if (c.bytes && trueortho::HardSeamsOnly(c.blend, static_cast<int>(job.blendWidth), used)) {
        HardSeamBytes(c, w, t, r, counts);
        return;
    }
    blend.values.resize(used);
    blend.seen.resize(used);
    // A scene weighs in the blend only where it sees the pixel clearly, or unclearly in its own
    // region where no scene of the blend sees it clearly: within the DBM pixel error of a
    // hidden pixel a scene's value is often the occluding roof's edge, or a mix of it with the
    // ground resampled across the depth step (on the sample city half of such pixels lie
    // more than 15 grey levels from the ideal image); blended in, they drew dotted lines along
    // the seams beside buildings. Where its own scene weighs nothing, a pixel near a seam takes
    // the other scenes' values, and keeps its own beyond their reach.
    // Feathering takes a scene's values (and visibility) only in the inner tile within its reach
    // (the border) of the scene's region: they are read there alone. Multiband blending takes
    // them over the whole tile.
    const Rect whole{0, 0, r.width, r.height};
    const Rect inner{c.border, c.border, t.width, t.height};
    if (c.blend == trueortho::BlendMode::Feather) {
        RegionBoxes(labels, r.width, whole, used, w.extents, w.boxes);
        for (Rect& box : w.boxes)
            box = box.Empty() ? box : box.Grown(c.border).Intersect(inner);
    } else {
        w.boxes.assign(used, whole);
    }
    Rect any{};  // the boxes' bounding box
    for (const Rect& box : w.boxes)
        any = any.Union(box);
    w.clear.assign(size, 0);
    for (size_t k = 0; k < n; ++k)
        if (w.slot[k] >= 0)
            for (int j = any.y; j < any.y + any.height; ++j) {
                const size_t first = static_cast<size_t>(j) * r.width + any.x;
                const unsigned char* state = w.scenes[k].state.data() + first;
                unsigned char* clear = w.clear.data() + first;
                for (int i = 0; i < any.width; ++i)
                    clear[i] |= state[i] == trueortho::kClear;
            }
    for (size_t k = 0; k < n; ++k) {
        if (w.slot[k] < 0)
            continue;
        const size_t u = static_cast<size_t>(w.slot[k]);
        const SceneTile& scene = w.scenes[k];
        const Rect& box = w.boxes[u];
        std::vector<unsigned char>& seen = blend.seen[u];
        seen.assign(size, 0);
        for (int j = box.y; j < box.y + box.height; ++j)
            for (int i = box.x; i < box.x + box.width; ++i) {
                const size_t p = static_cast<size_t>(j) * r.width + i;
                seen[p] = scene.state[p] == trueortho::kClear ||
                          (scene.state[p] == trueortho::kUnclear && !w.clear[p] &&
                           labels[p] == static_cast<int>(u));
            }
        c.reader.ReadBalanced(scene.scene, r, Rect{r.x + box.x, r.y + box.y, box.width, box.height},
                              c.fit.gain[scene.scene], c.fit.offset[scene.scene], scene.state,
                              c.range, w.scratch, blend.values[u]);
    }
    const float noData = static_cast<float>(c.grid.noData);
    trueortho::BlendRegions(blend, c.blend, static_cast<int>(job.blendWidth), noData, w.blended);

    gobs::Raster mosaic(t.width, t.height, bands, datasources::DataType::Float32,
                        gobs::Raster::Initial::Unset);
    gobs::Raster source(t.width, t.height, 1, datasources::DataType::Float32);
    float* out = static_cast<float*>(mosaic.GetData());
    float* from = static_cast<float*>(source.GetData());
    const size_t plane = t.Size();
    for (int j = 0; j < t.height; ++j)
        for (int i = 0; i < t.width; ++i) {
            const size_t o = static_cast<size_t>(j) * t.width + i;
            const int label = labels[static_cast<size_t>(j + c.border) * r.width + i + c.border];
            ++(label < 0 ? counts.unfilled : counts.filled);
            from[o] = label < 0 ? 0.0f : static_cast<float>(blend.scenes[label] + 1);
            for (int b = 0; b < bands; ++b)
                out[plane * b + o] =
                    label < 0 ? noData
                              : c.range.Besides(c.range(w.blended[plane * b + o]), c.grid.noData);
        }
    c.mosaic->WriteWindow(mosaic, t.x, t.y);
    c.source->WriteWindow(source, t.x, t.y);
}

// A writer of one of the outputs on the mosaic grid.
std::unique_ptr<datasources::BasicWriter> OutputWriter(const std::string& path,
                                                       const std::string& format,
                                                       const std::string& options,
                                                       const RecoveryGrid& grid, int bands,
                                                       GDALDataType type, double noData) {
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

// A file removed when the run ends, however it ends.
struct ScratchFile {
    std::string path;
    ~ScratchFile() {
        std::error_code ignored;
        if (!path.empty())
            std::filesystem::remove(path, ignored);
    }
};

// Seamlines chosen by the seam solver into a scratch label raster beside the source raster.
std::unique_ptr<trueortho::SharedRaster> ChooseSeamlines(const RecoveryJob& job,
                                                         const RecoveryGrid& grid,
                                                         const SceneReader& reader,
                                                         const trueortho::BalanceFit& fit,
                                                         unsigned int threads,
                                                         RunControl& control,
                                                         ScratchFile& scratch) {
    scratch.path = job.sourcePath + ".regions.tif";
    // Classes, read back tile by tile by the composition: options of a scene's classes (no
    // predictor, which is slow to undo on one band).
    auto labels = OutputWriter(scratch.path, "GTiff", SceneRasterOptions("GTiff", true), grid, 1,
                               GDT_UInt16, 0.0);
    const std::unique_ptr<trueortho::SeamSource> source =
        trueortho::MakeSeamSource(job, grid, reader, fit, control);
    trueortho::SeamParams params;
    params.pixelSize = trueortho::PixelMetres(grid);
    trueortho::ChooseRegions(
        *source, grid.pixels, grid.lines, params, threads, control,
        [&](int x0, int y0, int width, int height, const std::vector<std::uint16_t>& values) {
            gobs::Raster raster(width, height, 1, datasources::DataType::Float32,
                                gobs::Raster::Initial::Unset);
            std::copy(values.begin(), values.end(), static_cast<float*>(raster.GetData()));
            labels->WriteWindow(raster, x0, y0);
        });
    if (control.Stopped())
        return nullptr;
    labels->Close();
    return grid.OpenOnGrid(scratch.path, "regions");
}

}  // namespace

TorthoRecoveryResult OcclusionRecovery::Recover(const RecoveryJob& job) {
    RunControl control(CancelFlag(), Progress(), ProgressData());
    if (job.mosaicPath.empty() || job.sourcePath.empty() || job.mosaicPath == job.sourcePath)
        KESTREL_THROW(DataException,
                      "Occlusion recovery: the mosaic and the source raster need two different "
                      "output paths");
    if (job.tileSize < 16 || job.tileSize > 8192)
        KESTREL_THROW(DataException, FormatString("Occlusion recovery: tile size %u is outside "
                                                  "16 to 8192",
                                                  job.tileSize));
    if (job.blendWidth > RecoveryJob::kMaxBlendWidth)
        KESTREL_THROW(DataException, FormatString("Occlusion recovery: blend width %u is outside "
                                                  "0 to %u pixels",
                                                  job.blendWidth, RecoveryJob::kMaxBlendWidth));
    const RecoveryGrid grid = trueortho::InspectScenes(job);
    if (job.surface != nullptr && grid.crs)
        job.surface->SetInputCRS(grid.crs.get());
    if (job.ground != nullptr && grid.crs)
        job.ground->SetInputCRS(grid.crs.get());
    const SceneReader reader(job, grid);
    TorthoRecoveryResult result;
    if (control.Stopped())
        return result;
    std::unique_ptr<trueortho::SharedRaster> mask, regions;
    if (!job.maskPath.empty())
        mask = grid.OpenOnGrid(job.maskPath, "mask");
    if (!job.regionsPath.empty())
        regions = grid.OpenOnGrid(job.regionsPath, "regions raster");

    // Each tile reads the visibility with a border of the pixel error: tiles of at least twice
    // that (up to 1024) keep the border's share of the reading bounded.
    const int tile = static_cast<int>(
        std::max(job.tileSize, std::min(2u * static_cast<unsigned int>(grid.halo), 1024u)));
    const size_t tiles = grid.TileCount(tile);
    const unsigned int threads = static_cast<unsigned int>(std::min<size_t>(ThreadsToUse(), tiles));

    // 1. The balance, fitted where scenes overlap.
    const trueortho::BalanceMode balance =
        job.balance == RecoveryJob::Balance::None   ? trueortho::BalanceMode::None
        : job.balance == RecoveryJob::Balance::Gain ? trueortho::BalanceMode::Gain
                                                    : trueortho::BalanceMode::GainOffset;
    std::vector<trueortho::OverlapSamples> overlaps;
    // Progress: a fifth for the balance, two for the regions, two for the composition.
    control.SetSpan(0.0, 0.2);
    if (balance != trueortho::BalanceMode::None && job.scenes.size() > 1)
        overlaps = trueortho::GatherOverlaps(job, grid, reader, threads, control);
    if (control.Stopped())
        return result;
    const trueortho::BalanceFit fit =
        trueortho::FitBalance(job.scenes.size(), grid.bands, overlaps, balance);
    overlaps.clear();
    // Between the steps, what their threads freed goes back to the system (the next step's
    // threads would not reuse it).
    trueortho::ReleaseFreeMemory();

    // 2. The regions: the job's raster, seamlines, or none (the first-ranked scene per pixel).
    ScratchFile scratch;
    control.SetSpan(0.2, 0.4);
    if (!regions && job.seamlines) {
        regions = ChooseSeamlines(job, grid, reader, fit, threads, control, scratch);
        if (control.Stopped())
            return result;
        trueortho::ReleaseFreeMemory();
    }

    // 3. The composition, tile by tile.
    const bool cog = job.format == "COG";
    // A COG's tiles are compressed on the run's threads (the same bytes as on one), unless the
    // job's options say otherwise (later options win).
    const std::string threaded = cog ? FormatString("NUM_THREADS=%u ", threads) : std::string();
    auto mosaic = OutputWriter(job.mosaicPath, job.format, threaded + job.mosaicOptions, grid,
                               grid.bands, grid.type, grid.hasNoData ? grid.noData : 0.0);
    if (cog)
        mosaic->SetNoDataAsMask();
    auto source = OutputWriter(job.sourcePath, job.format,
                               cog ? threaded + "OVERVIEW_RESAMPLING=NEAREST" : "", grid, 1,
                               job.scenes.size() < 255 ? GDT_Byte : GDT_UInt16, 0.0);
    const trueortho::BlendMode blend = job.blend == RecoveryJob::Blend::Multiband
                                           ? trueortho::BlendMode::Multiband
                                           : trueortho::BlendMode::Feather;
    bool bytes = grid.type == GDT_Byte;
    for (const auto& ortho : grid.orthos)
        bytes = bytes && ortho->type == GDT_Byte;
    const float noData = static_cast<float>(grid.noData);
    unsigned char noDataByte = 0;
    ToBytes(&noData, &noDataByte, 1);
    const Composition composition{job,
                                  grid,
                                  reader,
                                  fit,
                                  regions.get(),
                                  mask.get(),
                                  blend,
                                  trueortho::BlendBorder(blend, static_cast<int>(job.blendWidth)),
                                  trueortho::ValueRange(grid.type),
                                  mosaic.get(),
                                  source.get(),
                                  bytes,
                                  noDataByte};
    control.SetSpan(0.6, 0.4);
    std::vector<TorthoRecoveryResult> counts(threads);
    std::vector<Worker> workers(threads);
    // Tiles in bands, so that the scene blocks two tiles share are still in GDAL's cache.
    control.RunTiles(tiles, threads, "Occlusion recovery", [&](unsigned int thread, size_t index) {
        Compose(composition, workers[thread], grid.Tile(tile, grid.InBands(tile, index)), control,
                counts[thread]);
    });
    if (control.Stopped())
        return result;
    // The scenes are read: their files and cached blocks go before the outputs are finished
    // (building overviews and compressing take memory of their own).
    grid.pool->CloseAll();
    regions.reset();
    mask.reset();
    trueortho::ReleaseFreeMemory();
    mosaic->Close();
    source->Close();
    trueortho::ReleaseFreeMemory();
    for (const auto& c : counts)
        result.filled += c.filled, result.unfilled += c.unfilled, result.sceneReads += c.sceneReads;
    result.gain = fit.gain;
    result.offset = fit.offset;
    result.completed = true;
    return result;
}

}  // namespace processes
}  // namespace kestrel
