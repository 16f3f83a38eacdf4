// What occlusion recovery hands the colour balance (samples where scenes overlap) and the seam
// solver (costs, brightness and raised heights over windows of the mosaic grid).
#include "recoverygrid.h"
#include "runcontrol.h"

#include <kestrel/exception.h>

#include <algorithm>
#include <cmath>
#include <tuple>
#include <unordered_map>

namespace kestrel {
namespace processes {
namespace trueortho {

namespace {

// The data cost of a scene at a pixel it sees: the tangent of its off-nadir angle (capped at
// kSteepest; kUnknownAngleCost where the angle is unknown, after every known one), plus
// kLevelStep per radiometric difference level, so that a lower level is always preferred where
// it sees, plus kUnclearCost where a hidden pixel of the scene lies within its DBM pixel error
// (above any difference of level, as in the choice without seamlines) and the pixel stands no
// more than kExposedRise above the lowest surface within that error: an error of the surface
// model can expose the ground beside a hidden strip, not the roof above it, whose edge the
// scene sees as well as the rest of the roof.
constexpr float kSteepest = 9.0f;  // about 84 degrees off nadir
constexpr float kUnknownAngleCost = 10.0f;
constexpr float kLevelStep = 100.0f;
constexpr float kUnclearCost = 1000.0f;
constexpr float kExposedRise = 1.0f;  // metres
// Ground estimated from the surface: a morphological opening with a square of this half-side.
// The opening keeps whatever the square fits inside, so its side (61 m) must exceed a building's
// smaller dimension (at 20 m a block of 50 x 45 m kept its roof as ground, and seams crossed it).
constexpr double kGroundRadius = 30.0;  // metres
constexpr int kMaxGroundRadius = 256;   // cells
// The ground is estimated once for the whole grid on cells of the coarse pass's size (about a
// metre: the opening's radius is tens of metres, so the ground is smooth at that scale), at most
// kMaxGroundCells of them (16 MB).
constexpr size_t kMaxGroundCells = size_t{4} << 20;
constexpr size_t kHeightSlice = 4096;  // cells of surface heights asked at a time

// `exposable`: the pixel stands no more than kExposedRise above the lowest surface near it.
float PixelCost(const SceneTile& tile, size_t p, int level, bool exposable) {
    const float angle = tile.angle[p];
    return (std::isinf(angle) ? kUnknownAngleCost : std::min(angle, kSteepest)) +
           kLevelStep * static_cast<float>(level) +
           (tile.state[p] == kUnclear && exposable ? kUnclearCost : 0);
}

class RecoverySeamSource : public SeamSource {
  public:
    RecoverySeamSource(const RecoveryJob& job, const RecoveryGrid& grid, const SceneReader& reader,
                       const BalanceFit& fit, const RunControl& control)
        : job_(job), grid_(grid), reader_(reader), fit_(fit), control_(control) {
        // Before any window is read: the windows are read from several threads.
        if (job_.surface != nullptr && job_.ground == nullptr)
            EstimateGround();
    }

    // Cells x0 to x0 + width - 1 (and y0 to y0 + height - 1) of factor x factor pixels. A cell is
    // forbidden to a scene that sees under half of its pixels; otherwise its cost is the mean
    // pixel cost over the pixels it sees, plus kUnclearCost times the share it does not see.
    // Raised heights: per cell, the highest within the largest DBM pixel error, so that a seam
    // priced on the lower side of its pair keeps that error off the raised object's outline.
    SeamWindow Read(int x0, int y0, int width, int height, int factor) override {
        return Read(x0, y0, width, height, factor, CellsNeeded());
    }

    // With `needed` at full resolution, the scenes' visibility is read over the whole window
    // first; then each scene's angles and values only over the part of each chunk that holds the
    // needed pixels it sees, and the surface only within the largest pixel error of the needed
    // pixels. (At a coarser factor the whole window is read.)
    SeamWindow Read(int x0, int y0, int width, int height, int factor,
                    const CellsNeeded& needed) override {
        SeamWindow window;
        window.width = width, window.height = height;
        const Layout at(x0, y0, width, height, factor, grid_.Whole());
        const bool whole = !needed || factor != 1;
        Relief relief;
        if (whole)
            relief = ReadRelief(at, {});
        if (control_.Stopped())
            return window;
        SceneReader::Scratch scratch;
        SceneTile tile;
        // One scene at a time, in chunks of about 256 pixels across: the sums of its pixel costs
        // and brightness per cell go straight into its arrays.
        std::vector<Sums> sums;
        std::vector<unsigned int> seen;  // per cell, the pixels the scene sees
        for (const size_t s : grid_.ScenesMeeting(at.in)) {
            Sums sum;
            sum.scene = s;
            for (const Rect& part : Chunks(at, s)) {
                if (control_.Stopped())
                    return window;  // no scene: the run is being abandoned
                if (!reader_.Read(s, part, whole, whole, scratch, tile))
                    continue;
                if (sum.cost.empty())
                    seen.assign(at.cells, 0), sum.cost.assign(at.cells, 0.0f),
                        sum.grey.assign(at.cells, 0.0f);
                Add(at, tile, part, part, &seen, whole, relief, {}, sum);
                if (!whole)
                    sum.states.emplace_back(part, tile.state);
            }
            if (sum.cost.empty())
                continue;
            sum.allowed.resize(at.cells);
            bool any = false;
            for (size_t c = 0; c < at.cells; ++c) {
                sum.allowed[c] = seen[c] > 0 && 2 * static_cast<size_t>(seen[c]) >= at.total[c];
                any = any || sum.allowed[c];
            }
            if (!any)
                continue;
            if (whole)
                Finish(at, seen, {}, sum);
            sums.push_back(std::move(sum));
        }
        std::vector<std::uint8_t> full;
        if (!whole) {
            for (const Sums& sum : sums) {
                window.scenes.push_back(sum.scene);
                window.cost.emplace_back(at.cells);
                for (size_t c = 0; c < at.cells; ++c)
                    window.cost.back()[c] = sum.allowed[c] ? 0.0f : kForbidden;
            }
            full = needed(window);
            if (full.size() != at.cells)
                KESTREL_THROW(DataException, "seam source: " + std::to_string(full.size()) +
                                                 " cells needed out of a window of " +
                                                 std::to_string(at.cells));
            window.scenes.clear(), window.cost.clear();
            relief = ReadRelief(at, full);
            for (Sums& sum : sums)
                if (!ReadNeeded(at, full, relief, scratch, tile, sum))
                    return window;
        }
        for (Sums& sum : sums) {
            if (!whole)  // at full resolution a scene sees the one pixel of each cell it may take
                Finish(at, std::vector<unsigned int>(sum.allowed.begin(), sum.allowed.end()),
                       full, sum);
            window.scenes.push_back(sum.scene);
            window.cost.push_back(std::move(sum.cost));
            window.grey.push_back(std::move(sum.grey));
        }
        window.raised = std::move(relief.raised);
        return window;
    }

  private:
    // A window of cells on the grid.
    struct Layout {
        Layout(int x0, int y0, int w, int h, int f, const Rect& whole)
            : width(w),
              height(h),
              factor(f),
              cells(static_cast<size_t>(w) * h),
              pixels{x0 * f, y0 * f, w * f, h * f},
              in(pixels.Intersect(whole)),
              total(cells) {
            for (int cy = 0; cy < h; ++cy)
                for (int cx = 0; cx < w; ++cx) {
                    // The cell's pixels inside the grid (fewer at its right and bottom edges).
                    const int left = pixels.x + cx * f, top = pixels.y + cy * f;
                    const int across = std::min(left + f, in.x + in.width) - std::max(left, in.x);
                    const int down = std::min(top + f, in.y + in.height) - std::max(top, in.y);
                    total[static_cast<size_t>(cy) * w + cx] =
                        static_cast<unsigned int>(std::max(0, across) * std::max(0, down));
                }
        }
        size_t Cell(int x, int y) const {
            return static_cast<size_t>((y - pixels.y) / factor) * width + (x - pixels.x) / factor;
        }
        int width, height, factor;
        size_t cells;
        Rect pixels, in;
        std::vector<unsigned int> total;  // per cell
    };

    // One scene's window: whether it may take each cell, the sums of the costs and brightness of
    // the pixels it sees (their means once finished), and its pixel states over the chunks read
    // (kept only to read the needed pixels after).
    struct Sums {
        size_t scene = 0;
        std::vector<std::uint8_t> allowed;
        std::vector<float> cost, grey;
        std::vector<std::pair<Rect, std::vector<unsigned char>>> states;
    };

    // Per cell of a window: the highest raised height within the largest DBM pixel error, and
    // how far the cell stands above the lowest surface within it (metres; empty without a
    // surface model).
    struct Relief {
        std::vector<float> raised, rise;
    };

    // The chunks scene s is read in: its part of the window cut into squares of about 256
    // pixels, whole cells.
    std::vector<Rect> Chunks(const Layout& at, size_t s) const {
        const int factor = at.factor, chunk = std::max(factor, 256 / factor * factor);
        const Rect sceneIn = at.in.Intersect(grid_.windows[s]);
        std::vector<Rect> parts;
        for (int cy = at.in.y; cy < at.in.y + at.in.height; cy += chunk)
            for (int cx = at.in.x; cx < at.in.x + at.in.width; cx += chunk) {
                const Rect part = Rect{cx, cy, chunk, chunk}.Intersect(sceneIn);
                if (!part.Empty())
                    parts.push_back(part);
            }
        return parts;
    }

    // Adds the pixels of `part` that the scene sees (`tile` holds it over `read`, which holds
    // `part`): their count per cell into `seen` if given, and if `values` the sums of their
    // costs and brightness in the cells `full` names (empty: all).
    void Add(const Layout& at, const SceneTile& tile, const Rect& read, const Rect& part,
             std::vector<unsigned int>* seen, bool values, const Relief& relief,
             const std::vector<std::uint8_t>& full, Sums& sum) const {
        const int level = job_.scenes[sum.scene].radiometricLevel;
        std::vector<size_t> column(static_cast<size_t>(part.width));  // per pixel, its cell's
        for (int i = 0; i < part.width; ++i)
            column[i] = at.Cell(part.x + i, at.pixels.y);
        for (int j = 0; j < part.height; ++j) {
            const size_t row = at.Cell(at.pixels.x, part.y + j);
            const size_t line = static_cast<size_t>(part.y - read.y + j) * read.width +
                                static_cast<size_t>(part.x - read.x);
            for (int i = 0; i < part.width; ++i) {
                const size_t p = line + i;
                if (tile.state[p] == kNotSeen)
                    continue;
                const size_t c = row + column[i];
                if (seen != nullptr)
                    ++(*seen)[c];
                if (!values || (!full.empty() && !full[c]))
                    continue;
                sum.cost[c] += PixelCost(tile, p, level, relief.rise[c] <= kExposedRise);
                double grey = 0;
                for (int b = 0; b < grid_.bands; ++b)
                    grey += fit_.gain[sum.scene][b] * tile.values[read.Size() * b + p] +
                            fit_.offset[sum.scene][b];
                sum.grey[c] += static_cast<float>(grey / grid_.bands);
            }
        }
    }

    // The scene's cells from its sums and the pixels it sees of each (`seen`): kForbidden where
    // it may not take the cell; else, in the cells `full` names (empty: all), the mean pixel cost
    // plus kUnclearCost times the share it does not see, and the mean brightness.
    static void Finish(const Layout& at, const std::vector<unsigned int>& seen,
                       const std::vector<std::uint8_t>& full, Sums& sum) {
        for (size_t c = 0; c < at.cells; ++c) {
            if (!sum.allowed[c]) {
                sum.cost[c] = kForbidden, sum.grey[c] = 0;
            } else if (full.empty() || full[c]) {
                sum.cost[c] = sum.cost[c] / seen[c] +
                              kUnclearCost * static_cast<float>(at.total[c] - seen[c]) / at.total[c];
                sum.grey[c] /= seen[c];
            }
        }
    }

    // Adds to the scene's sums its pixels in the cells `full` names (at full resolution): its
    // values over the box of those it sees in each chunk, its angles over the chunk (so that
    // they come out as a read of the whole chunk gives them) in the lattice cells holding them.
    // False once the run stops.
    bool ReadNeeded(const Layout& at, const std::vector<std::uint8_t>& full, const Relief& relief,
                    SceneReader::Scratch& scratch, SceneTile& tile, Sums& sum) const {
        tile.scene = sum.scene;
        std::vector<unsigned char> cells;
        std::vector<float> angles;
        for (const auto& [chunk, states] : sum.states) {
            if (control_.Stopped())
                return false;
            const int across = AngleCells(chunk.width);
            cells.assign(static_cast<size_t>(across) * AngleCells(chunk.height), 0);
            int x0 = chunk.width, x1 = 0, y0 = chunk.height, y1 = 0;  // the box, in the chunk
            for (int y = 0; y < chunk.height; ++y) {
                const size_t row = at.Cell(chunk.x, chunk.y + y);
                for (int x = 0; x < chunk.width; ++x)
                    if (full[row + x] && sum.allowed[row + x]) {
                        x0 = std::min(x0, x), x1 = std::max(x1, x + 1), y0 = std::min(y0, y);
                        y1 = y + 1;
                        cells[static_cast<size_t>(y / kAngleStep) * across + x / kAngleStep] = 1;
                    }
            }
            if (x1 <= x0)
                continue;
            reader_.ReadAngles(chunk, scratch, tile, &cells);
            const Rect box{chunk.x + x0, chunk.y + y0, x1 - x0, y1 - y0};
            angles.swap(tile.angle);
            tile.angle.resize(box.Size()), tile.state.resize(box.Size());
            for (int j = 0; j < box.height; ++j) {
                const size_t from = static_cast<size_t>(y0 + j) * chunk.width + x0;
                const size_t to = static_cast<size_t>(j) * box.width;
                std::copy_n(angles.begin() + static_cast<std::ptrdiff_t>(from), box.width,
                            tile.angle.begin() + static_cast<std::ptrdiff_t>(to));
                std::copy_n(states.begin() + static_cast<std::ptrdiff_t>(from), box.width,
                            tile.state.begin() + static_cast<std::ptrdiff_t>(to));
            }
            reader_.ReadValues(sum.scene, box, tile.values);
            Add(at, tile, box, box, nullptr, true, relief, full, sum);
        }
        return true;
    }

    // The relief of the cells `full` names (empty: all; 0 elsewhere), from the surface heights
    // within the largest pixel error of them.
    Relief ReadRelief(const Layout& at, const std::vector<std::uint8_t>& full) const {
        const int width = at.width, height = at.height;
        Relief relief;
        relief.rise.assign(at.cells, 0.0f);
        if (job_.surface == nullptr)
            return relief;
        const int factor = at.factor, m = (grid_.halo + factor - 1) / factor;
        const int w = width + 2 * m, h = height + 2 * m;
        std::vector<float> reach;  // nonzero where a needed cell's square reaches
        if (!full.empty()) {
            reach.assign(static_cast<size_t>(w) * h, 0.0f);
            for (int j = 0; j < height; ++j)
                for (int i = 0; i < width; ++i)
                    reach[static_cast<size_t>(j + m) * w + i + m] =
                        full[static_cast<size_t>(j) * width + i];
            SquareFilter(reach, w, h, m, true);
        }
        const std::vector<float> raised =
            Raised(at.pixels.x / factor - m, at.pixels.y / factor - m, w, h, factor, reach);
        if (control_.Stopped())
            return relief;
        std::vector<float> highest = raised, lowest = raised;
        SquareFilter(highest, w, h, m, true);
        SquareFilter(lowest, w, h, m, false);
        relief.raised.assign(at.cells, 0.0f);
        for (int j = 0; j < height; ++j)
            for (int i = 0; i < width; ++i) {
                const size_t c = static_cast<size_t>(j) * width + i;
                const size_t k = static_cast<size_t>(j + m) * w + i + m;
                if (!full.empty() && !full[c])
                    continue;
                relief.raised[c] = (raised[k] + highest[k]) / 2;
                relief.rise[c] = raised[k] - lowest[k];
            }
        return relief;
    }

    // Heights at the centres of cells [x0, x0 + width) x [y0, y0 + height) that `mask` names
    // (empty: all); NaN where none or not asked. Asked in slices of lines (a vertical datum
    // conversion makes them slow), each after a look at the run's control: once it stops, the
    // rest stay NaN.
    std::vector<float> Heights(const dem::IElevationSource& source, int x0, int y0, int width,
                               int height, int factor, const std::vector<float>& mask) const {
        const size_t cells = static_cast<size_t>(width) * height;
        std::vector<size_t> asked;
        std::vector<double> x, y;
        const auto& g = grid_.geoTransform;
        for (int j = 0; j < height; ++j)
            for (int i = 0; i < width; ++i) {
                const size_t c = static_cast<size_t>(j) * width + i;
                if (!mask.empty() && mask[c] == 0)
                    continue;
                const double p = (x0 + i + 0.5) * factor, l = (y0 + j + 0.5) * factor;
                asked.push_back(c);
                x.push_back(g[0] + p * g[1] + l * g[2]), y.push_back(g[3] + p * g[4] + l * g[5]);
            }
        std::vector<double> h(asked.size(), NAN);
        const size_t slice = std::max<size_t>(1, kHeightSlice / std::max(1, width)) * width;
        for (size_t k = 0; k < asked.size() && !control_.Stopped(); k += slice)
            source.GetHeights(std::min(slice, asked.size() - k), &x[k], &y[k], &h[k]);
        std::vector<float> heights(cells, NAN);
        for (size_t k = 0; k < asked.size(); ++k)
            heights[asked[k]] = static_cast<float>(h[k]);
        return heights;
    }

    // Metres the surface stands above the ground at the cells `mask` names (empty: all; 0
    // elsewhere): against the job's ground when given, else against the grid's ground estimate
    // (EstimateGround).
    std::vector<float> Raised(int x0, int y0, int width, int height, int factor,
                              const std::vector<float>& mask) const {
        if (job_.surface == nullptr)
            return {};
        std::vector<float> raised = Heights(*job_.surface, x0, y0, width, height, factor, mask);
        std::vector<float> ground;
        if (job_.ground != nullptr)
            ground = Heights(*job_.ground, x0, y0, width, height, factor, mask);
        for (int j = 0; j < height; ++j)
            for (int i = 0; i < width; ++i) {
                const size_t c = static_cast<size_t>(j) * width + i;
                if (!mask.empty() && mask[c] == 0) {
                    raised[c] = 0.0f;
                    continue;
                }
                const float d = raised[c] - (ground.empty() ? GroundAt((x0 + i + 0.5) * factor,
                                                                       (y0 + j + 0.5) * factor)
                                                            : ground[c]);
                raised[c] = std::isfinite(d) ? std::max(0.0f, d) : 0.0f;
            }
        return raised;
    }

    // The ground under the whole grid: the surface's opening with a square of half-side
    // kGroundRadius, on cells of groundFactor_ pixels, each the surface height at its centre.
    void EstimateGround() {
        const double pixelMetres = PixelMetres(grid_);
        const size_t gridPixels = static_cast<size_t>(grid_.pixels) * grid_.lines;
        groundFactor_ = std::max(
            CoarseFactor(grid_.pixels, grid_.lines, pixelMetres),
            static_cast<int>(std::ceil(std::sqrt(static_cast<double>(gridPixels) / kMaxGroundCells))));
        const int f = groundFactor_;
        groundWidth_ = static_cast<int>((grid_.pixels + f - 1) / f);
        groundHeight_ = static_cast<int>((grid_.lines + f - 1) / f);
        if (groundWidth_ == 0 || groundHeight_ == 0)
            return;
        std::vector<float> heights;
        heights.reserve(static_cast<size_t>(groundWidth_) * groundHeight_);
        // In bands of lines, so that the coordinates asked stay small.
        const int band = std::max(1, static_cast<int>(kHeightSlice * 16 / groundWidth_));
        for (int y = 0; y < groundHeight_ && !control_.Stopped(); y += band) {
            const std::vector<float> h =
                Heights(*job_.surface, 0, y, groundWidth_, std::min(band, groundHeight_ - y), f, {});
            heights.insert(heights.end(), h.begin(), h.end());
        }
        if (control_.Stopped())
            return;  // no window is read once the run stops
        const int radius = std::min(
            kMaxGroundRadius, static_cast<int>(std::ceil(kGroundRadius / (pixelMetres * f))));
        // The opening is the heights less what stands above it.
        const std::vector<float> above = RaisedHeights(heights, groundWidth_, groundHeight_, radius);
        for (size_t c = 0; c < heights.size(); ++c)
            heights[c] -= above[c];
        ground_ = std::move(heights);
    }

    // The ground at pixel coordinates (px, py) of the grid, bilinear between the centres of the
    // ground cells (nearest would step the ground by a cell's rise on a slope), from the finite
    // ones among the four; NaN where none is.
    float GroundAt(double px, double py) const {
        if (ground_.empty())
            return NAN;
        const double u = std::clamp(px / groundFactor_ - 0.5, 0.0, groundWidth_ - 1.0);
        const double v = std::clamp(py / groundFactor_ - 0.5, 0.0, groundHeight_ - 1.0);
        const int i = std::min(static_cast<int>(u), std::max(0, groundWidth_ - 2));
        const int j = std::min(static_cast<int>(v), std::max(0, groundHeight_ - 2));
        const double fu = u - i, fv = v - j;
        double sum = 0, weights = 0;
        for (int dj = 0; dj < 2 && j + dj < groundHeight_; ++dj)
            for (int di = 0; di < 2 && i + di < groundWidth_; ++di) {
                const float g = ground_[static_cast<size_t>(j + dj) * groundWidth_ + i + di];
                const double w = (di ? fu : 1 - fu) * (dj ? fv : 1 - fv);
                if (std::isfinite(g) && w > 0)
                    sum += w * g, weights += w;
            }
        return weights > 0 ? static_cast<float>(sum / weights) : NAN;
    }

    const RecoveryJob& job_;
    const RecoveryGrid& grid_;
    const SceneReader& reader_;
    const BalanceFit& fit_;
    const RunControl& control_;
    std::vector<float> ground_;  // groundWidth_ x groundHeight_ cells; empty until estimated
    int groundFactor_ = 1, groundWidth_ = 0, groundHeight_ = 0;
};

}  // namespace

double PixelMetres(const RecoveryGrid& grid) {
    const double size = std::hypot(grid.geoTransform[1], grid.geoTransform[4]);
    // Metres per degree on a geographic grid, near enough for a seam cost.
    return grid.crs && grid.crs->IsGeographic() ? size * 111320.0 : size;
}

ValueRange::ValueRange(GDALDataType type) : integer_(GDALDataTypeIsInteger(type) != 0) {
    lo_ = GDALAdjustValueToDataType(type, -1e300, nullptr, nullptr);
    hi_ = GDALAdjustValueToDataType(type, 1e300, nullptr, nullptr);
}

float ValueRange::Beside(double noData) const {
    const double step = integer_ ? 1.0 : std::max(1e-6, std::fabs(noData) * 1e-6);
    return static_cast<float>(noData + step <= hi_ ? noData + step : noData - step);
}

std::vector<OverlapSamples> GatherOverlaps(const RecoveryJob& job, const RecoveryGrid& grid,
                                           const SceneReader& reader, unsigned int threads,
                                           RunControl& control) {
    // The pairs of scenes whose windows meet, each with its sampling stride.
    struct Pair {
        size_t a, b;
        int stride;
    };
    std::vector<Pair> pairs;
    std::unordered_map<unsigned long long, size_t> index;
    const unsigned long long count = job.scenes.size();
    for (size_t a = 0; a < grid.windows.size(); ++a)
        for (const size_t b : grid.ScenesMeeting(grid.windows[a])) {
            if (b <= a)
                continue;
            index[a * count + b] = pairs.size();
            pairs.push_back({a, b, 1});
        }
    if (pairs.empty())
        return {};
    const double budget = std::min(kPairSamples, std::max(kFewestSamples, kTotalSamples / pairs.size()));
    for (Pair& pair : pairs) {
        const double area =
            static_cast<double>(grid.windows[pair.a].Intersect(grid.windows[pair.b]).Size());
        pair.stride = std::max(1, static_cast<int>(std::ceil(std::sqrt(area / budget))));
    }

    // Tiles of the grid; each thread keeps its samples per tile and pair, put in order after.
    struct Chunk {
        size_t tile, pair;
        std::vector<float> a, b;
    };
    const int side = RecoveryGrid::kBucket;
    const size_t tiles = grid.TileCount(side);
    // The samples are sparse (one pixel in stride x stride of a pair), but every block of a
    // scene holds some: the tile is read whole, its states and values taken at the samples
    // alone (Byte values as they are).
    struct Scene {
        size_t scene;
        int e;
        std::vector<unsigned char> visibility, bytes;  // bytes: of a Byte ortho
        std::vector<float> values;                     // of another
    };
    struct Worker {
        SceneReader::Scratch scratch;
        std::vector<Scene> scenes;
        std::vector<Chunk> chunks;
    };
    std::vector<Worker> workers(std::max(1u, threads));
    const ValueRange range(grid.type);
    control.RunTiles(tiles, static_cast<unsigned int>(workers.size()), "Colour balance",
                     [&](unsigned int thread, size_t q) {
        Worker& w = workers[thread];
        const size_t t = grid.InBands(side, q);
        const Rect r = grid.Tile(side, t);
        const std::vector<size_t> meeting = grid.ScenesMeeting(r);
        if (meeting.size() < 2)
            return;
        size_t n = 0;
        for (const size_t s : meeting) {
            if (w.scenes.size() <= n)
                w.scenes.emplace_back();
            Scene& scene = w.scenes[n];
            if (!reader.ReadVisibility(s, r, w.scratch, scene.visibility))
                continue;
            scene.scene = s, scene.e = job.scenes[s].dbmPixelError;
            if (!reader.ReadBytes(s, r, scene.bytes))
                reader.ReadValues(s, r, scene.values);
            ++n;
        }
        const auto clear = [&](const Scene& scene, int i, int j) {
            return SeenClearly(scene.visibility.data(), r.width + 2 * scene.e, scene.e, i, j);
        };
        const auto value = [&](const Scene& scene, int band, size_t p) {
            const size_t k = r.Size() * band + p;
            return scene.bytes.empty() ? scene.values[k] : static_cast<float>(scene.bytes[k]);
        };
        for (size_t k = 0; k < n; ++k)
            for (size_t l = k + 1; l < n; ++l) {
                const Scene &a = w.scenes[k], &b = w.scenes[l];
                const auto found = index.find(a.scene * count + b.scene);
                if (found == index.end())
                    continue;
                const int stride = pairs[found->second].stride;
                Chunk chunk{t, found->second, {}, {}};
                const int j0 = (stride - r.y % stride) % stride;
                const int i0 = (stride - r.x % stride) % stride;
                for (int j = j0; j < r.height; j += stride)
                    for (int i = i0; i < r.width; i += stride) {
                        const size_t p = static_cast<size_t>(j) * r.width + i;
                        if (!clear(a, i, j) || !clear(b, i, j))
                            continue;
                        // Pixels clipped in either scene would pull the fit towards the clip.
                        bool clipped = false;
                        for (int band = 0; band < grid.bands && !clipped; ++band)
                            clipped = range.Clipped(value(a, band, p)) ||
                                      range.Clipped(value(b, band, p));
                        if (clipped)
                            continue;
                        for (int band = 0; band < grid.bands; ++band) {
                            chunk.a.push_back(value(a, band, p));
                            chunk.b.push_back(value(b, band, p));
                        }
                    }
                if (!chunk.a.empty())
                    w.chunks.push_back(std::move(chunk));
            }
    });
    std::vector<Chunk> chunks;
    for (Worker& w : workers)
        std::move(w.chunks.begin(), w.chunks.end(), std::back_inserter(chunks));
    std::sort(chunks.begin(), chunks.end(), [](const Chunk& x, const Chunk& y) {
        return std::tie(x.pair, x.tile) < std::tie(y.pair, y.tile);
    });
    std::vector<OverlapSamples> overlaps;
    for (Chunk& chunk : chunks) {
        if (overlaps.empty() || overlaps.back().a != pairs[chunk.pair].a ||
            overlaps.back().b != pairs[chunk.pair].b) {
            overlaps.emplace_back();
            overlaps.back().a = pairs[chunk.pair].a, overlaps.back().b = pairs[chunk.pair].b;
        }
        auto& o = overlaps.back();
        o.valuesA.insert(o.valuesA.end(), chunk.a.begin(), chunk.a.end());
        o.valuesB.insert(o.valuesB.end(), chunk.b.begin(), chunk.b.end());
        std::vector<float>().swap(chunk.a), std::vector<float>().swap(chunk.b);
    }
    // Each band's values of the two scenes paired by rank (quantile against quantile) rather
    // than by pixel: two orthos of the same ground differ pixel by pixel through resampling and
    // sub-pixel misregistration, which as noise in both variables would bias the fitted gains
    // (on fine textures to gains of 0.1 and 5); their distributions differ only by exposure.
    std::vector<float> a, b;
    for (OverlapSamples& o : overlaps) {
        const size_t n = o.valuesA.size() / grid.bands;
        for (int band = 0; band < grid.bands; ++band) {
            a.resize(n), b.resize(n);
            for (size_t k = 0; k < n; ++k)
                a[k] = o.valuesA[k * grid.bands + band], b[k] = o.valuesB[k * grid.bands + band];
            std::sort(a.begin(), a.end());
            std::sort(b.begin(), b.end());
            for (size_t k = 0; k < n; ++k)
                o.valuesA[k * grid.bands + band] = a[k], o.valuesB[k * grid.bands + band] = b[k];
        }
    }
    return overlaps;
}

std::unique_ptr<SeamSource> MakeSeamSource(const RecoveryJob& job, const RecoveryGrid& grid,
                                           const SceneReader& reader, const BalanceFit& fit,
                                           const RunControl& control) {
    return std::make_unique<RecoverySeamSource>(job, grid, reader, fit, control);
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
