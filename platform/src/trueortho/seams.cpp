// Seamlines: alpha-expansion over a max-flow solver, a coarse pass over the whole grid and a
// full-resolution refinement near the coarse seams.
#include "seams.h"

#include <kestrel/exception.h>

#include "maxflow.h"
#include "runcontrol.h"

#include <algorithm>
#include <cmath>
#include <mutex>
#include <string>

namespace kestrel {
namespace processes {
namespace trueortho {

namespace {

// Expansion cycles: each lowers the energy less than the one before; a few reach its floor. The
// refinement starts from the coarse labels, already near it: on the 16-image block a second
// cycle moved 0.05 % of the pixels for 6 % of the mosaic step's time.
constexpr int kMaxCycles = 4;
constexpr int kRefineCycles = 1;
// The coarse grid's cells are about kCoarseCell metres and at least kMinFactor pixels on a side,
// and the whole coarse grid at most kMaxCoarseCells: fine enough to see streets between
// buildings, coarse enough that the seam term does not dwarf the data term cell by cell.
constexpr double kCoarseCell = 1.0;
constexpr int kMinFactor = 4;
constexpr std::size_t kMaxCoarseCells = std::size_t{16} << 20;
// Coarse cells either side of the two along a coarse seam left free at full resolution. On the
// sample city 1 places the seams as 3 does (bench_mosaic) with half the free pixels.
constexpr int kBand = 1;
// Cells per side of a coarse window at most (64 images of 1000 x 1000 pixels: 512 held
// 15 MB more at the peak than 256, for the same time).
constexpr int kCoarseBlock = 256;
// The share of the progress the coarse pass takes.
constexpr double kCoarseShare = 0.2;

std::size_t Cells(const SeamWindow& w) {
    return static_cast<std::size_t>(w.width) * static_cast<std::size_t>(w.height);
}

void CheckWindow(const SeamWindow& w) {
    const std::size_t cells = Cells(w);
    auto fail = [&](const std::string& what) {
        KESTREL_THROW(DataException, "seam window of " + std::to_string(w.width) + " x " +
                                         std::to_string(w.height) + " cells: " + what);
    };
    if (w.width < 0 || w.height < 0)
        fail("negative size");
    if (w.cost.size() != w.scenes.size())
        fail(std::to_string(w.cost.size()) + " cost arrays for " + std::to_string(w.scenes.size()) +
             " scenes");
    if (!w.grey.empty() && w.grey.size() != w.scenes.size())
        fail(std::to_string(w.grey.size()) + " grey arrays for " + std::to_string(w.scenes.size()) +
             " scenes");
    for (std::size_t k = 0; k < w.scenes.size(); ++k)
        if (w.cost[k].size() != cells || (!w.grey.empty() && w.grey[k].size() != cells))
            fail("scene " + std::to_string(w.scenes[k]) + " has arrays of the wrong size");
    if (!w.raised.empty() && w.raised.size() != cells)
        fail("raised heights of the wrong size");
    if (!w.fixed.empty() && w.fixed.size() != cells)
        fail("fixed labels of the wrong size");
    for (int f : w.fixed)
        if (f >= static_cast<int>(w.scenes.size()))
            fail("a fixed label " + std::to_string(f) + " beyond its " +
                 std::to_string(w.scenes.size()) + " scenes");
}

bool Allowed(float cost) {
    return cost < kForbidden;  // also false for NaN
}

// The terms of the energy over one window.
class Energy {
  public:
    Energy(const SeamWindow& w, const SeamParams& p)
        : w_(w),
          seam_(static_cast<float>(p.seamWeight / p.pixelSize)),
          raised_(static_cast<float>(p.raisedWeight / p.pixelSize)),
          colour_(static_cast<float>(p.colourWeight / p.pixelSize)) {}

    bool Free(std::size_t c) const { return w_.fixed.empty() || w_.fixed[c] < 0; }
    float Data(std::size_t c, int label) const { return w_.cost[label][c]; }

    // The cost of a seam between cells p and q labelled a and b. A metric in the labels where
    // both scenes see both cells; where one does not, its colour does not count.
    float Pair(std::size_t p, std::size_t q, int a, int b) const {
        if (a == b || a < 0 || b < 0)
            return 0;
        float v = seam_;
        if (!w_.raised.empty())
            v += raised_ * std::min(Raised(p), Raised(q));
        if (!w_.grey.empty())
            v += colour_ * (Disagreement(p, a, b) + Disagreement(q, a, b));
        return v;
    }

    double Total(const std::vector<int>& labels) const {
        double e = 0;
        const int W = w_.width, H = w_.height;
        for (int y = 0; y < H; ++y)
            for (int x = 0; x < W; ++x) {
                const std::size_t c = static_cast<std::size_t>(y) * W + x;
                if (Free(c) && labels[c] >= 0)
                    e += Data(c, labels[c]);
                if (x + 1 < W)
                    e += Pair(c, c + 1, labels[c], labels[c + 1]);
                if (y + 1 < H)
                    e += Pair(c, c + W, labels[c], labels[c + W]);
            }
        return e;
    }

  private:
    float Raised(std::size_t c) const {
        const float r = w_.raised[c];
        return r > 0 && std::isfinite(r) ? r : 0.0f;
    }
    float Disagreement(std::size_t c, int a, int b) const {
        if (!Allowed(w_.cost[a][c]) || !Allowed(w_.cost[b][c]))
            return 0;
        const float d = std::fabs(w_.grey[a][c] - w_.grey[b][c]);
        return std::isfinite(d) ? d : 0.0f;
    }

    const SeamWindow& w_;
    float seam_, raised_, colour_;
};

// Adds e0 to the node's cost when it keeps its label (source side), e1 when it takes alpha.
void AddUnary(MaxFlow& g, int node, float e0, float e1) {
    const float m = std::min(e0, e1);
    g.AddTerminal(node, e0 - m, e1 - m);
}

// What the expansions of one window share: the free cells (those that may change label, in
// raster order), per cell its node in the current graph (-1: none) and the graph.
struct Expansions {
    std::vector<std::size_t> free;
    std::vector<int> node;
    std::vector<std::size_t> taking;  // the cells that take alpha
    MaxFlow graph;
};

// One expansion move: every free cell may keep its label or take alpha, at the least energy.
// Returns the change of energy it made (<= 0). Only the free cells are visited, so that a
// window mostly held to known labels costs little.
double Expand(const SeamWindow& w, const Energy& energy, int alpha, std::vector<int>& labels,
              Expansions& x) {
    const int W = w.width, H = w.height;
    std::vector<int>& node = x.node;
    int nodes = 0;
    for (const std::size_t c : x.free)
        if (labels[c] >= 0 && labels[c] != alpha && Allowed(energy.Data(c, alpha)))
            node[c] = nodes++;
    if (nodes == 0)
        return 0;
    MaxFlow& graph = x.graph;
    graph.Reset(nodes, 2 * static_cast<std::size_t>(nodes));
    // Per variable cell p its data term and the pairs with its neighbours: with a variable
    // neighbour q (counted once, from the first of the two) an edge, with a fixed one a unary
    // term.
    auto pair = [&](std::size_t p, std::size_t q) {
        const int np = node[p], nq = node[q], lp = labels[p], lq = labels[q];
        if (nq < 0) {
            AddUnary(graph, np, energy.Pair(p, q, lp, lq), energy.Pair(p, q, alpha, lq));
        } else if (p < q) {
            // E(keep, keep) = A, E(keep, alpha) = B, E(alpha, keep) = C, E(alpha, alpha) = 0
            // as A + (C - A) x_p - C x_q + (B + C - A) (1 - x_p) x_q. Where the colour term is
            // not a metric, A is lowered to B + C; the move is then checked on the true energy.
            const float B = energy.Pair(p, q, lp, alpha), C = energy.Pair(p, q, alpha, lq);
            const float A = std::min(energy.Pair(p, q, lp, lq), B + C);
            AddUnary(graph, np, 0, C - A);
            AddUnary(graph, nq, 0, -C);
            graph.AddEdge(np, nq, B + C - A, 0);
        }
    };
    for (const std::size_t c : x.free) {
        if (node[c] < 0)
            continue;
        AddUnary(graph, node[c], energy.Data(c, labels[c]), energy.Data(c, alpha));
        const int cx = static_cast<int>(c % W), cy = static_cast<int>(c / W);
        if (cx > 0)
            pair(c, c - 1);
        if (cx + 1 < W)
            pair(c, c + 1);
        if (cy > 0)
            pair(c, c - W);
        if (cy + 1 < H)
            pair(c, c + W);
    }
    graph.Solve();

    // The change of energy, over the cells that take alpha and their neighbours.
    x.taking.clear();
    for (const std::size_t c : x.free)
        if (node[c] >= 0 && graph.OnSinkSide(node[c]))
            x.taking.push_back(c);
    auto next = [&](std::size_t q) {
        return node[q] >= 0 && graph.OnSinkSide(node[q]) ? alpha : labels[q];
    };
    double delta = 0;
    for (const std::size_t c : x.taking) {
        delta += energy.Data(c, alpha) - energy.Data(c, labels[c]);
        const int cx = static_cast<int>(c % W), cy = static_cast<int>(c / W);
        auto neighbour = [&](std::size_t q) {
            const int lq = next(q);
            // A pair of two cells taking alpha is counted from its first cell.
            if (lq == alpha && labels[q] != alpha && q < c)
                return;
            delta += energy.Pair(c, q, alpha, lq) - energy.Pair(c, q, labels[c], labels[q]);
        };
        if (cx > 0)
            neighbour(c - 1);
        if (cx + 1 < W)
            neighbour(c + 1);
        if (cy > 0)
            neighbour(c - W);
        if (cy + 1 < H)
            neighbour(c + W);
    }
    for (const std::size_t c : x.free)
        node[c] = -1;
    if (delta >= 0)
        return 0;
    for (const std::size_t c : x.taking)
        labels[c] = alpha;
    return delta;
}

}  // namespace

double SeamEnergy(const SeamWindow& window, const SeamParams& params,
                  const std::vector<int>& labels) {
    CheckWindow(window);
    if (labels.size() != Cells(window))
        KESTREL_THROW(DataException, "seam labels: " + std::to_string(labels.size()) + " for " +
                                         std::to_string(Cells(window)) + " cells");
    return Energy(window, params).Total(labels);
}

namespace {

// Minimises the energy from a start: per cell a label (fixed cells: theirs), or -1 for the
// cheapest allowed one, also where the label given is not allowed. Expands every scene, or
// only those of the start and of the fixed cells (where the start comes from a coarser level).
std::vector<int> Solve(const SeamWindow& window, const SeamParams& params, std::vector<int> labels,
                       bool everyScene) {
    const Energy energy(window, params);
    const std::size_t cells = Cells(window);
    const int scenes = static_cast<int>(window.scenes.size());
    std::vector<bool> present(static_cast<std::size_t>(scenes), everyScene);
    for (std::size_t c = 0; c < cells; ++c) {
        if (!energy.Free(c)) {
            // A fixed neighbour's scene may go on into the free cells.
            labels[c] = window.fixed[c];
            present[static_cast<std::size_t>(labels[c])] = true;
            continue;
        }
        if (labels[c] < 0 || !Allowed(energy.Data(c, labels[c]))) {
            float best = kForbidden;
            labels[c] = -1;
            for (int k = 0; k < scenes; ++k)
                if (energy.Data(c, k) < best)
                    best = energy.Data(c, k), labels[c] = k;
        }
        if (labels[c] >= 0)
            present[static_cast<std::size_t>(labels[c])] = true;
    }
    if (scenes < 2)
        return labels;
    Expansions x;
    x.node.assign(cells, -1);
    for (std::size_t c = 0; c < cells; ++c)
        if (energy.Free(c) && labels[c] >= 0)
            x.free.push_back(c);
    // The total is needed only to stop early: a single cycle reads no cell beyond the free ones
    // and their neighbours.
    const int cycles = everyScene ? kMaxCycles : kRefineCycles;
    double total = cycles > 1 ? energy.Total(labels) : 0;
    for (int cycle = 0; cycle < cycles; ++cycle) {
        double gain = 0;
        for (int alpha = 0; alpha < scenes; ++alpha)
            if (present[static_cast<std::size_t>(alpha)])
                gain -= Expand(window, energy, alpha, labels, x);
        // Gains below the float terms' rounding are no gains.
        if (cycle + 1 == cycles || gain <= 1e-6 * std::max(1.0, std::fabs(total)))
            break;
        total -= gain;
    }
    return labels;
}

}  // namespace

std::vector<int> SolveSeams(const SeamWindow& window, const SeamParams& params) {
    CheckWindow(window);
    return Solve(window, params, std::vector<int>(Cells(window), -1), true);
}

namespace {

// The running minimum (or maximum) over [i - radius, i + radius] of n values at stride
// `stride`, O(1) per value (van Herk / Gil-Werman): prefix and suffix extremes within blocks
// of 2 radius + 1. `identity` stands for missing values and beyond the ends.
template <typename T, typename Pick>
void RunningExtreme(T* data, int n, std::size_t stride, int radius, T identity, Pick pick,
                    std::vector<T>& prefix, std::vector<T>& suffix) {
    if (radius <= 0 || n <= 0)
        return;
    const int k = 2 * radius + 1;
    const int padded = ((n + 2 * radius + k - 1) / k) * k;
    prefix.assign(static_cast<std::size_t>(padded), identity);
    suffix.assign(static_cast<std::size_t>(padded), identity);
    auto at = [&](int i) {  // padded index i is value i - radius
        const int j = i - radius;
        return j >= 0 && j < n ? data[static_cast<std::size_t>(j) * stride] : identity;
    };
    for (int b = 0; b < padded; b += k) {
        prefix[b] = at(b);
        for (int i = b + 1; i < b + k; ++i)
            prefix[i] = pick(prefix[i - 1], at(i));
        suffix[b + k - 1] = at(b + k - 1);
        for (int i = b + k - 2; i >= b; --i)
            suffix[i] = pick(suffix[i + 1], at(i));
    }
    for (int j = 0; j < n; ++j)  // value j's window is padded [j, j + 2 radius]
        data[static_cast<std::size_t>(j) * stride] = pick(suffix[j], prefix[j + 2 * radius]);
}

// The extreme over a square of side 2 radius + 1 around each cell, in place.
template <typename T, typename Pick>
void SquareExtreme(std::vector<T>& grid, int width, int height, int radius, T identity, Pick pick) {
    std::vector<T> prefix, suffix;
    for (int y = 0; y < height; ++y)
        RunningExtreme(grid.data() + static_cast<std::size_t>(y) * width, width, 1, radius,
                       identity, pick, prefix, suffix);
    for (int x = 0; x < width; ++x)
        RunningExtreme(grid.data() + x, height, static_cast<std::size_t>(width), radius, identity,
                       pick, prefix, suffix);
}

}  // namespace

void SquareFilter(std::vector<float>& grid, int width, int height, int radius, bool highest) {
    if (width < 0 || height < 0 ||
        grid.size() != static_cast<std::size_t>(width) * static_cast<std::size_t>(height))
        KESTREL_THROW(DataException, "square filter: " + std::to_string(grid.size()) +
                                         " values for a grid of " + std::to_string(width) + " x " +
                                         std::to_string(height));
    const float inf = std::numeric_limits<float>::infinity();
    if (highest)
        SquareExtreme(grid, width, height, radius, -inf,
                      [](float a, float b) { return std::max(a, b); });
    else
        SquareExtreme(grid, width, height, radius, inf,
                      [](float a, float b) { return std::min(a, b); });
}

std::vector<float> RaisedHeights(const std::vector<float>& heights, int width, int height,
                                 int radius) {
    if (width < 0 || height < 0 ||
        heights.size() != static_cast<std::size_t>(width) * static_cast<std::size_t>(height))
        KESTREL_THROW(DataException, "raised heights: " + std::to_string(heights.size()) +
                                         " heights for a grid of " + std::to_string(width) + " x " +
                                         std::to_string(height));
    const float lowest = -std::numeric_limits<float>::infinity();
    const float highest = std::numeric_limits<float>::infinity();
    auto smaller = [](float a, float b) { return std::min(a, b); };
    auto larger = [](float a, float b) { return std::max(a, b); };
    // Erosion ignoring missing heights, then dilation ignoring cells whose square had none.
    std::vector<float> opened(heights.size());
    for (std::size_t c = 0; c < heights.size(); ++c)
        opened[c] = std::isfinite(heights[c]) ? heights[c] : highest;
    SquareExtreme(opened, width, height, radius, highest, smaller);
    for (float& v : opened)
        if (v == highest)
            v = lowest;
    SquareExtreme(opened, width, height, radius, lowest, larger);
    std::vector<float> raised(heights.size(), 0.0f);
    for (std::size_t c = 0; c < heights.size(); ++c)
        if (std::isfinite(heights[c]) && std::isfinite(opened[c]))
            raised[c] = std::max(0.0f, heights[c] - opened[c]);
    return raised;
}

int CoarseFactor(unsigned int pixels, unsigned int lines, double pixelSize) {
    int f = kMinFactor;
    if (pixelSize > 0 && kCoarseCell / pixelSize < 1 << 16)
        f = std::max(f, static_cast<int>(std::lround(kCoarseCell / pixelSize)));
    auto cells = [&](int factor) {
        return static_cast<std::size_t>((pixels + factor - 1) / factor) *
               ((lines + factor - 1) / factor);
    };
    while (cells(f) > kMaxCoarseCells)
        ++f;
    return f;
}

namespace {

// A grid of width x height cells cut into squares of `size` (the last ones narrower), coloured
// like a chessboard: the squares of one colour are solved apart from each other, then those of
// the other with the first ones' labels held around them, so that neighbours meet exactly.
struct Chessboard {
    int width, height, size;
    int Across() const { return (width + size - 1) / size; }
    int Down() const { return (height + size - 1) / size; }
    // The squares of colour 0 or 1, as indices i + j Across().
    std::vector<std::size_t> Squares(int colour) const {
        std::vector<std::size_t> squares;
        for (int j = 0; j < Down(); ++j)
            for (int i = 0; i < Across(); ++i)
                if ((i + j) % 2 == colour)
                    squares.push_back(static_cast<std::size_t>(j) * Across() + i);
        return squares;
    }
    struct Square {
        int x0, y0, w, h;
    };
    Square Get(std::size_t index) const {
        const int i = static_cast<int>(index % Across()), j = static_cast<int>(index / Across());
        return {i * size, j * size, std::min(size, width - i * size),
                std::min(size, height - j * size)};
    }
    // The square widened by `margin` cells on the sides where the grid goes on.
    Square Widened(const Square& s, int margin) const {
        const int x0 = std::max(0, s.x0 - margin), y0 = std::max(0, s.y0 - margin);
        return {x0, y0, std::min(width, s.x0 + s.w + margin) - x0,
                std::min(height, s.y0 + s.h + margin) - y0};
    }
};

// The labels of one tile's outermost lines and columns, as 1 + scene.
struct TileEdges {
    std::vector<std::uint16_t> top, bottom, left, right;
};

// The region chooser's state: the coarse labels (1 + scene, 0: none) of the whole grid, the band
// around their seams, and the edges of the full-resolution tiles solved first.
class RegionChooser {
  public:
    RegionChooser(SeamSource& source, unsigned int pixels, unsigned int lines,
                  const SeamParams& params, const RunControl& control)
        : source_(source),
          spanStart_(control.SpanStart()),
          spanShare_(control.SpanShare()),
          params_(params),
          tile_(std::max(16, params.tile)),
          factor_(CoarseFactor(pixels, lines, params.pixelSize)),
          cw_((static_cast<int>(pixels) + factor_ - 1) / factor_),
          ch_((static_cast<int>(lines) + factor_ - 1) / factor_),
          coarse_(static_cast<std::size_t>(cw_) * ch_, 0),
          fine_{static_cast<int>(pixels), static_cast<int>(lines), tile_},
          blocks_{cw_, ch_, CoarseBlock() - 2 * (CoarseBlock() / 16)} {
        coarseParams_ = params;
        coarseParams_.pixelSize = params.pixelSize * factor_;
    }

    // Cells per side of the coarse pass's windows: each holds a cost and a grey array per scene
    // it meets, and a coarse window spans many more scenes than a full-resolution tile does.
    int CoarseBlock() const { return std::min(tile_, kCoarseBlock); }

    // The coarse labels: blocks of one colour with a margin solved but not kept (for context),
    // then those of the other colour with a margin of one cell held to their neighbours' labels.
    void SolveCoarse(unsigned int threads, RunControl& control) {
        const int margin = CoarseBlock() / 16;
        ByColour(
            blocks_, threads, control, "Choosing seamlines (coarse)", 0.0, kCoarseShare,
            [&](int colour, std::size_t, const Chessboard::Square& core) {
                const Chessboard::Square win = blocks_.Widened(core, colour == 0 ? margin : 1);
                SeamWindow window = Read(win, factor_);
                if (colour == 1)
                    Hold(window, win,
                         [&](int x, int y) { return Beside(core, x, y) ? Coarse(x, y) : 0; });
                const std::vector<int> labels =
                    Solve(window, coarseParams_, std::vector<int>(Cells(window), -1), true);
                for (int y = core.y0; y < core.y0 + core.h; ++y)
                    for (int x = core.x0; x < core.x0 + core.w; ++x)
                        coarse_[static_cast<std::size_t>(y) * cw_ + x] = Scene(
                            window,
                            labels[static_cast<std::size_t>(y - win.y0) * win.w + (x - win.x0)]);
            });
    }

    // Full resolution, tiles of one colour then the other (held to the first ones' edges): cells
    // far from a coarse seam keep the coarse label, the band around the coarse seams is solved
    // again.
    void Refine(unsigned int threads, RunControl& control, const LabelSink& sink) {
        MarkBand();
        std::vector<TileEdges> edges(static_cast<std::size_t>(fine_.Across()) * fine_.Down());
        std::mutex sinkMutex;
        ByColour(
            fine_, threads, control, "Choosing seamlines", kCoarseShare, 1.0,
            [&](int colour, std::size_t square, const Chessboard::Square& core) {
                const Chessboard::Square win = fine_.Widened(core, colour);
                auto held = [&](int x, int y) -> int {
                    if (colour == 1 && !Inside(core, x, y))
                        return Beside(core, x, y) ? Neighbour(edges, x, y) : 0;
                    const std::size_t c = CoarseCell(x, y);
                    return band_[c] ? 0 : coarse_[c];
                };
                // Most cells keep their held label: only the free ones and their neighbours are
                // read in full. Which cells are held depends only on which scenes see them (a
                // read cut short by a stop holds no scenes).
                std::vector<int> fixed;
                std::vector<std::size_t> scenes;
                SeamWindow window = Read(win, 1, [&](const SeamWindow& allowed) {
                    fixed = Labels(allowed, win, held);
                    scenes = allowed.scenes;
                    return Needed(allowed, fixed);
                });
                window.fixed = !fixed.empty() && scenes == window.scenes
                                   ? std::move(fixed)
                                   : Labels(window, win, held);
                Reach(window, win);
                // The band starts from the coarse labels and may take only their scenes
                // (and those that see what they do not).
                const std::vector<int> start = Labels(
                    window, win, [&](int x, int y) { return coarse_[CoarseCell(x, y)]; });
                const std::vector<int> labels = Solve(window, params_, start, false);
                std::vector<std::uint16_t> out(static_cast<std::size_t>(core.w) * core.h);
                for (int y = 0; y < core.h; ++y)
                    for (int x = 0; x < core.w; ++x)
                        out[static_cast<std::size_t>(y) * core.w + x] = Scene(
                            window, labels[static_cast<std::size_t>(y + core.y0 - win.y0) * win.w +
                                           (x + core.x0 - win.x0)]);
                if (colour == 0)
                    edges[square] = Edges(out, core.w, core.h);
                std::lock_guard<std::mutex> lock(sinkMutex);
                sink(core.x0, core.y0, core.w, core.h, out);
            });
    }

  private:
    // work(colour, index, square) for the squares of one colour, then of the other, on threads,
    // their progress from `from` to `to` of the run's span.
    template <typename Work>
    void ByColour(const Chessboard& board, unsigned int threads, RunControl& control,
                  const char* message, double from, double to, Work work) const {
        for (int colour = 0; colour < 2 && !control.Stopped(); ++colour) {
            const double half = (to - from) / 2;
            control.SetSpan(spanStart_ + spanShare_ * (from + colour * half), spanShare_ * half);
            const std::vector<std::size_t> squares = board.Squares(colour);
            control.RunTiles(squares.size(), threads, message, [&](unsigned int, std::size_t i) {
                work(colour, squares[i], board.Get(squares[i]));
            });
        }
    }

    static bool Inside(const Chessboard::Square& s, int x, int y) {
        return x >= s.x0 && x < s.x0 + s.w && y >= s.y0 && y < s.y0 + s.h;
    }
    // A cell just outside the square that shares a side with it (not a corner).
    static bool Beside(const Chessboard::Square& s, int x, int y) {
        const bool across = x >= s.x0 && x < s.x0 + s.w, down = y >= s.y0 && y < s.y0 + s.h;
        return !(across && down) && (across || down);
    }

    static TileEdges Edges(const std::vector<std::uint16_t>& labels, int w, int h) {
        TileEdges e;
        e.top.assign(labels.begin(), labels.begin() + w);
        e.bottom.assign(labels.end() - w, labels.end());
        for (int y = 0; y < h; ++y) {
            e.left.push_back(labels[static_cast<std::size_t>(y) * w]);
            e.right.push_back(labels[static_cast<std::size_t>(y) * w + w - 1]);
        }
        return e;
    }

    // The label of a pixel on the edge of a tile of the first colour.
    int Neighbour(const std::vector<TileEdges>& edges, int x, int y) const {
        const int i = x / tile_, j = y / tile_;
        const Chessboard::Square s = fine_.Get(static_cast<std::size_t>(j) * fine_.Across() + i);
        const TileEdges& e = edges[static_cast<std::size_t>(j) * fine_.Across() + i];
        if (x == s.x0)
            return e.left[static_cast<std::size_t>(y - s.y0)];
        if (x == s.x0 + s.w - 1)
            return e.right[static_cast<std::size_t>(y - s.y0)];
        return y == s.y0 ? e.top[static_cast<std::size_t>(x - s.x0)]
                         : e.bottom[static_cast<std::size_t>(x - s.x0)];
    }

    SeamWindow Read(const Chessboard::Square& s, int factor, const CellsNeeded& needed = {}) {
        SeamWindow window = needed ? source_.Read(s.x0, s.y0, s.w, s.h, factor, needed)
                                   : source_.Read(s.x0, s.y0, s.w, s.h, factor);
        if (window.width != s.w || window.height != s.h)
            KESTREL_THROW(DataException, "seam source: asked for " + std::to_string(s.w) + " x " +
                                             std::to_string(s.h) + " cells at (" +
                                             std::to_string(s.x0) + ", " + std::to_string(s.y0) +
                                             ") reduced " + std::to_string(factor) +
                                             " times, got " + std::to_string(window.width) + " x " +
                                             std::to_string(window.height));
        CheckWindow(window);
        return window;
    }

    // The coarse cell holding pixel (x, y).
    std::size_t CoarseCell(int x, int y) const {
        return static_cast<std::size_t>(y / factor_) * cw_ + x / factor_;
    }

    std::uint16_t Coarse(int x, int y) const {
        return coarse_[static_cast<std::size_t>(y) * cw_ + x];
    }

    static std::uint16_t Scene(const SeamWindow& window, int label) {
        return label < 0 ? 0 : static_cast<std::uint16_t>(window.scenes[label] + 1);
    }

    // Per 1 + scene, its index into the window's scenes, or -1.
    static std::vector<int> SceneIndex(const SeamWindow& window) {
        std::vector<int> index;
        for (std::size_t k = 0; k < window.scenes.size(); ++k) {
            if (window.scenes[k] + 2 > index.size())
                index.resize(window.scenes[k] + 2, -1);
            index[window.scenes[k] + 1] = static_cast<int>(k);
        }
        return index;
    }

    // Per cell of the window (at s in the grid), the index into its scenes of the scene
    // scene(x, y) names (1 + scene; <= 0: none), or -1 where that scene is not in the window or
    // does not see the cell.
    template <typename SceneAt>
    static std::vector<int> Labels(const SeamWindow& window, const Chessboard::Square& s,
                                   SceneAt sceneAt) {
        const std::vector<int> index = SceneIndex(window);
        std::vector<int> labels(Cells(window), -1);
        for (int y = 0; y < s.h; ++y)
            for (int x = 0; x < s.w; ++x) {
                const int scene = sceneAt(s.x0 + x, s.y0 + y);
                if (scene <= 0 || static_cast<std::size_t>(scene) >= index.size())
                    continue;
                const int k = index[static_cast<std::size_t>(scene)];
                const std::size_t c = static_cast<std::size_t>(y) * s.w + x;
                if (k >= 0 && Allowed(window.cost[k][c]))
                    labels[c] = k;
            }
        return labels;
    }

    // What a single expansion cycle reads of a window whose cells are held to `fixed` (-1:
    // free): the data costs of the free cells that some scene sees, and the seam terms between
    // them and their four neighbours.
    static std::vector<std::uint8_t> Needed(const SeamWindow& window,
                                            const std::vector<int>& fixed) {
        static_assert(kRefineCycles == 1, "a further cycle would weigh the energy's total, over "
                                          "every cell");
        const int W = window.width, H = window.height;
        std::vector<std::uint8_t> needed(Cells(window), 0);
        for (int y = 0; y < H; ++y)
            for (int x = 0; x < W; ++x) {
                const std::size_t c = static_cast<std::size_t>(y) * W + x;
                bool seen = false;
                for (std::size_t k = 0; k < window.scenes.size() && !seen && fixed[c] < 0; ++k)
                    seen = Allowed(window.cost[k][c]);
                if (!seen)
                    continue;
                needed[c] = 1;
                if (x > 0)
                    needed[c - 1] = 1;
                if (x + 1 < W)
                    needed[c + 1] = 1;
                if (y > 0)
                    needed[c - W] = 1;
                if (y + 1 < H)
                    needed[c + W] = 1;
            }
        return needed;
    }

    // Fixes the cells of the window (at s in the grid) to the scene held(x, y) names (1 + scene;
    // <= 0: free), where that scene sees the cell.
    template <typename Held>
    static void Hold(SeamWindow& window, const Chessboard::Square& s, Held held) {
        window.fixed = Labels(window, s, held);
    }

    // Forbids each band pixel of the window (at s in the grid) the scenes that are not the coarse
    // label of a cell within kBand + 1 coarse cells, where one of those sees it: the band moves
    // the seams it lies along, and an expansion of a scene from elsewhere in the window would
    // make the whole band a graph of long augmenting paths for nothing.
    void Reach(SeamWindow& window, const Chessboard::Square& s) const {
        const std::size_t scenes = window.scenes.size();
        if (scenes < 2 || scenes > 64)
            return;
        using Mask = std::uint64_t;
        const int reach = kBand + 1;
        const int x0 = std::max(0, s.x0 / factor_ - reach), y0 = std::max(0, s.y0 / factor_ - reach);
        const int x1 = std::min(cw_, (s.x0 + s.w - 1) / factor_ + reach + 1);
        const int y1 = std::min(ch_, (s.y0 + s.h - 1) / factor_ + reach + 1);
        const int w = x1 - x0, h = y1 - y0;
        const std::vector<int> index = SceneIndex(window);
        std::vector<Mask> near(static_cast<std::size_t>(w) * h, 0);
        for (int y = 0; y < h; ++y)
            for (int x = 0; x < w; ++x) {
                const std::uint16_t label = Coarse(x0 + x, y0 + y);
                if (label > 0 && label < index.size() && index[label] >= 0)
                    near[static_cast<std::size_t>(y) * w + x] = Mask{1} << index[label];
            }
        SquareExtreme(near, w, h, reach, Mask{0}, [](Mask a, Mask b) { return a | b; });
        for (int y = 0; y < s.h; ++y)
            for (int x = 0; x < s.w; ++x) {
                const int cx = (s.x0 + x) / factor_, cy = (s.y0 + y) / factor_;
                if (!band_[static_cast<std::size_t>(cy) * cw_ + cx])
                    continue;
                const Mask allowed = near[static_cast<std::size_t>(cy - y0) * w + (cx - x0)];
                const std::size_t c = static_cast<std::size_t>(y) * s.w + x;
                bool seen = false;
                for (std::size_t k = 0; k < scenes && !seen; ++k)
                    seen = (allowed >> k & 1) && Allowed(window.cost[k][c]);
                if (!seen)
                    continue;
                for (std::size_t k = 0; k < scenes; ++k)
                    if (!(allowed >> k & 1))
                        window.cost[k][c] = kForbidden;
            }
    }

    // Coarse cells within kBand cells of a change of coarse label.
    void MarkBand() {
        band_.assign(coarse_.size(), 0);
        for (int y = 0; y < ch_; ++y)
            for (int x = 0; x < cw_; ++x) {
                const std::uint16_t l = Coarse(x, y);
                const std::size_t c = static_cast<std::size_t>(y) * cw_ + x;
                if (x + 1 < cw_ && Coarse(x + 1, y) != l)
                    band_[c] = band_[c + 1] = 1;
                if (y + 1 < ch_ && Coarse(x, y + 1) != l)
                    band_[c] = band_[c + cw_] = 1;
            }
        SquareExtreme(band_, cw_, ch_, kBand, std::uint8_t{0},
                      [](std::uint8_t a, std::uint8_t b) { return std::max(a, b); });
    }

    SeamSource& source_;
    const double spanStart_, spanShare_;  // the run's progress span, shared by the passes
    const SeamParams params_;
    SeamParams coarseParams_;
    const int tile_, factor_, cw_, ch_;
    std::vector<std::uint16_t> coarse_;
    std::vector<std::uint8_t> band_;
    const Chessboard fine_, blocks_;
};

}  // namespace

void ChooseRegions(SeamSource& source, unsigned int pixels, unsigned int lines,
                   const SeamParams& params, unsigned int threads, RunControl& control,
                   const LabelSink& sink) {
    if (pixels == 0 || lines == 0)
        return;
    if (!(params.pixelSize > 0))
        KESTREL_THROW(DataException, "seamlines: pixel size " + std::to_string(params.pixelSize) +
                                         " m is not positive");
    const double spanStart = control.SpanStart(), spanShare = control.SpanShare();
    RegionChooser chooser(source, pixels, lines, params, control);
    chooser.SolveCoarse(threads, control);
    if (!control.Stopped())
        chooser.Refine(threads, control, sink);
    control.SetSpan(spanStart, spanShare);
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
