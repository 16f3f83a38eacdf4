// Seamlines: the solver against brute force, seams around raised ground, the region chooser's
// tiles meeting, and the raised heights against their definition.
#include "../platform/src/trueortho/maxflow.h"
#include "../platform/src/trueortho/runcontrol.h"
#include "../platform/src/trueortho/seams.h"

#include <kestrel/exception.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <functional>
#include <map>
#include <mutex>
#include <random>

using namespace kestrel::processes::trueortho;

namespace {

std::size_t Index(int x, int y, int width) {
    return static_cast<std::size_t>(y) * width + x;
}

// A window of `scenes` scenes with random costs, greys and raised heights; some costs
// forbidden (every scene at cell 0) and some cells fixed.
SeamWindow RandomWindow(unsigned seed, int width, int height, int scenes, bool withFixed) {
    std::mt19937 rng(seed);
    std::uniform_real_distribution<float> unit(0.0f, 1.0f);
    SeamWindow w;
    w.width = width;
    w.height = height;
    const std::size_t cells = static_cast<std::size_t>(width) * height;
    for (int k = 0; k < scenes; ++k) {
        w.scenes.push_back(static_cast<std::size_t>(3 * k + 1));
        w.cost.emplace_back(cells);
        w.grey.emplace_back(cells);
        for (std::size_t c = 0; c < cells; ++c) {
            w.cost[k][c] = c == 0 || unit(rng) < 0.15f ? kForbidden : unit(rng);
            w.grey[k][c] = 100 + 40 * unit(rng);
        }
    }
    for (std::size_t c = 0; c < cells; ++c)
        w.raised.push_back(unit(rng) < 0.3f ? 3 * unit(rng) : 0.0f);
    if (withFixed) {
        w.fixed.assign(cells, -1);
        w.fixed[cells - 1] = 0;
        w.fixed[cells / 2] = scenes - 1;
    }
    return w;
}

// The labels a cell may take: its fixed label, its allowed scenes, or -1 when none sees it.
std::vector<std::vector<int>> Choices(const SeamWindow& w) {
    std::vector<std::vector<int>> choices(static_cast<std::size_t>(w.width) * w.height);
    for (std::size_t c = 0; c < choices.size(); ++c) {
        if (!w.fixed.empty() && w.fixed[c] >= 0) {
            choices[c] = {w.fixed[c]};
            continue;
        }
        for (std::size_t k = 0; k < w.scenes.size(); ++k)
            if (w.cost[k][c] < kForbidden)
                choices[c].push_back(static_cast<int>(k));
        if (choices[c].empty())
            choices[c] = {-1};
    }
    return choices;
}

// The least energy over every labelling whose cell c takes a label that accept(c, label) lets.
double BruteForce(const SeamWindow& w, const SeamParams& p,
                  const std::function<bool(std::size_t, int)>& accept) {
    std::vector<std::vector<int>> choices = Choices(w);
    for (std::size_t c = 0; c < choices.size(); ++c) {
        auto& options = choices[c];
        options.erase(
            std::remove_if(options.begin(), options.end(), [&](int l) { return !accept(c, l); }),
            options.end());
    }
    std::vector<std::size_t> pick(choices.size(), 0);
    std::vector<int> labels(choices.size());
    double best = INFINITY;
    for (;;) {
        for (std::size_t c = 0; c < choices.size(); ++c)
            labels[c] = choices[c][pick[c]];
        best = std::min(best, SeamEnergy(w, p, labels));
        std::size_t c = 0;
        while (c < pick.size() && ++pick[c] == choices[c].size())
            pick[c++] = 0;
        if (c == pick.size())
            return best;
    }
}

// The maximum flow by shortest augmenting paths over a dense capacity matrix (node n: source,
// n + 1: sink).
double ReferenceFlow(std::vector<std::vector<double>> cap) {
    const std::size_t n = cap.size(), s = n - 2, t = n - 1;
    double flow = 0;
    for (;;) {
        std::vector<int> parent(n, -1);
        parent[s] = static_cast<int>(s);
        std::vector<std::size_t> queue{s};
        for (std::size_t q = 0; q < queue.size() && parent[t] < 0; ++q)
            for (std::size_t v = 0; v < n; ++v)
                if (parent[v] < 0 && cap[queue[q]][v] > 1e-9)
                    parent[v] = static_cast<int>(queue[q]), queue.push_back(v);
        if (parent[t] < 0)
            return flow;
        double b = INFINITY;
        for (std::size_t v = t; v != s; v = parent[v])
            b = std::min(b, cap[parent[v]][v]);
        for (std::size_t v = t; v != s; v = parent[v])
            cap[parent[v]][v] -= b, cap[v][parent[v]] += b;
        flow += b;
    }
}

TEST(MaxFlow, CutsAsLittleAsAugmentingPathsOnGrids) {
    // Grids whose neighbour capacities are weak, like data terms, or strong, like seam terms.
    struct Case {
        int width, height;
        float neighbour;
    };
    const Case cases[] = {{6, 5, 0.5f}, {14, 12, 5.0f}, {20, 18, 40.0f}};
    std::mt19937 rng(3);
    std::uniform_real_distribution<float> unit(0.0f, 1.0f);
    for (const Case& k : cases) {
        SCOPED_TRACE(::testing::Message()
                     << k.width << "x" << k.height << " neighbour " << k.neighbour);
        const int n = k.width * k.height;
        std::vector<std::vector<double>> cap(n + 2, std::vector<double>(n + 2, 0.0));
        MaxFlow graph;
        graph.Reset(n, 2 * static_cast<std::size_t>(n));
        std::vector<float> source(n), sink(n);
        for (int v = 0; v < n; ++v) {
            source[v] = unit(rng), sink[v] = unit(rng);
            graph.AddTerminal(v, source[v], sink[v]);
            cap[n][v] += sink[v];  // cut when v ends on the sink side
            cap[v][n + 1] += source[v];
        }
        std::vector<std::array<float, 4>> edges;
        for (int y = 0; y < k.height; ++y)
            for (int x = 0; x < k.width; ++x)
                for (int v : {x + 1 < k.width ? y * k.width + x + 1 : -1,
                              y + 1 < k.height ? (y + 1) * k.width + x : -1})
                    if (v >= 0) {
                        const int u = y * k.width + x;
                        const float f = k.neighbour * unit(rng), b = k.neighbour * unit(rng);
                        graph.AddEdge(u, v, f, b);
                        cap[u][v] += f, cap[v][u] += b;
                        edges.push_back({float(u), float(v), f, b});
                    }
        const double flow = graph.Solve();
        EXPECT_NEAR(flow, ReferenceFlow(cap), 1e-3 * std::max(1.0, flow));
        // The sides it gives cut exactly that much.
        double cut = 0;
        for (int v = 0; v < n; ++v)
            cut += graph.OnSinkSide(v) ? sink[v] : source[v];
        for (const auto& e : edges) {
            const bool u = graph.OnSinkSide(int(e[0])), v = graph.OnSinkSide(int(e[1]));
            cut += !u && v ? e[2] : u && !v ? e[3] : 0.0f;
        }
        EXPECT_NEAR(cut, flow, 1e-3 * std::max(1.0, flow));
    }
}

TEST(SolveSeams, MinimalEnergyAgainstBruteForceAndWindowsThatDoNotFitAreRefused) {
    struct Case {
        int width, height, scenes;
        bool fixed;
    };
    const Case cases[] = {
        {3, 3, 2, false}, {4, 3, 2, true}, {3, 2, 3, false}, {3, 2, 3, true}, {2, 3, 4, false}};
    SeamParams params;
    params.pixelSize = 0.5;
    for (const Case& k : cases)
        for (unsigned seed = 1; seed <= 6; ++seed) {
            SCOPED_TRACE(::testing::Message() << k.width << "x" << k.height << " scenes "
                                              << k.scenes << " seed " << seed);
            const SeamWindow w = RandomWindow(seed, k.width, k.height, k.scenes, k.fixed);
            const std::vector<int> labels = SolveSeams(w, params);
            const auto choices = Choices(w);
            for (std::size_t c = 0; c < labels.size(); ++c)
                EXPECT_NE(std::find(choices[c].begin(), choices[c].end(), labels[c]),
                          choices[c].end())
                    << "cell " << c << " took " << labels[c];
            const double energy = SeamEnergy(w, params, labels);
            const double tolerance = 1e-4 * std::max(1.0, energy);
            // Two scenes: expansions reach the least energy. More: no expansion move lowers it.
            if (k.scenes == 2) {
                EXPECT_NEAR(energy, BruteForce(w, params, [](std::size_t, int) { return true; }),
                            tolerance);
            }
            for (int alpha = 0; alpha < k.scenes; ++alpha)
                EXPECT_GE(
                    BruteForce(w, params,
                               [&](std::size_t c, int l) { return l == labels[c] || l == alpha; }),
                    energy - tolerance)
                    << "expanding " << alpha;
        }
    // Windows whose arrays do not fit, or whose fixed cells name no scene, are refused.
    SeamWindow w = RandomWindow(1, 4, 4, 2, false);
    w.cost[1].pop_back();
    EXPECT_THROW(SolveSeams(w, SeamParams{}), kestrel::DataException);
    w = RandomWindow(1, 4, 4, 2, true);
    w.fixed[3] = 2;
    EXPECT_THROW(SolveSeams(w, SeamParams{}), kestrel::DataException);
}

// Two scenes that see everything; scene 0 is cheaper left of `crossing`, scene 1 right of it;
// a raised block stands on the crossing. In metres with `pixel` metres a pixel.
struct Field {
    double pixel = 1.0;
    double crossing = 20, width = 40, height = 40;
    double blockX0 = 15, blockX1 = 25, blockY0 = 10, blockY1 = 28, blockHeight = 8;
    double Raised(double x, double y) const {
        return x >= blockX0 && x < blockX1 && y >= blockY0 && y < blockY1 ? blockHeight : 0;
    }
    float Cost(int scene, double x) const {
        const double t = x / width;
        return static_cast<float>(scene == 0 ? t : 1 - t);
    }
};

// The window of a field at full resolution.
SeamWindow FieldWindow(const Field& f) {
    SeamWindow w;
    w.width = static_cast<int>(std::lround(f.width / f.pixel));
    w.height = static_cast<int>(std::lround(f.height / f.pixel));
    w.scenes = {0, 1};
    w.cost.assign(2, {});
    for (int y = 0; y < w.height; ++y)
        for (int x = 0; x < w.width; ++x) {
            const double mx = (x + 0.5) * f.pixel, my = (y + 0.5) * f.pixel;
            w.cost[0].push_back(f.Cost(0, mx));
            w.cost[1].push_back(f.Cost(1, mx));
            w.raised.push_back(static_cast<float>(f.Raised(mx, my)));
        }
    return w;
}

// Per line, the columns where the label changes; and how many seam pairs lie over raised cells
// (both cells raised; a seam along a raised block's outline is not over it).
struct SeamTrace {
    std::vector<std::vector<int>> changes;
    int onRaised = 0;
};

template <typename Label>
SeamTrace Trace(const std::vector<Label>& labels, const std::vector<float>& raised, int width,
                int height) {
    SeamTrace t;
    t.changes.resize(static_cast<std::size_t>(height));
    for (int y = 0; y < height; ++y)
        for (int x = 0; x < width; ++x) {
            const std::size_t c = Index(x, y, width);
            if (x + 1 < width && labels[c] != labels[c + 1]) {
                t.changes[y].push_back(x);
                t.onRaised += raised[c] > 0 && raised[c + 1] > 0;
            }
            if (y + 1 < height && labels[c] != labels[c + width])
                t.onRaised += raised[c] > 0 && raised[c + width] > 0;
        }
    return t;
}

TEST(SolveSeams, SeamGoesAroundRaisedGroundAtAnyPixelSize) {
    struct Case {
        double pixel;
        float raisedWeight;
        bool around;
    };
    const Case cases[] = {{1.0, 2.0f, true}, {0.25, 2.0f, true}, {1.0, 0.0f, false}};
    for (const Case& k : cases) {
        SCOPED_TRACE(::testing::Message()
                     << "pixel " << k.pixel << " m, raised weight " << k.raisedWeight);
        Field f;
        f.pixel = k.pixel;
        const SeamWindow w = FieldWindow(f);
        SeamParams p;
        p.pixelSize = k.pixel;
        p.raisedWeight = k.raisedWeight;
        const std::vector<int> labels = SolveSeams(w, p);
        const SeamTrace t = Trace(labels, w.raised, w.width, w.height);
        for (int y = 0; y < w.height; ++y)
            EXPECT_EQ(t.changes[y].size(), 1u) << "line " << y;
        if (k.around)
            EXPECT_EQ(t.onRaised, 0);
        else
            EXPECT_GT(t.onRaised, 0);
    }
}

// A field as a seam source: reduced cells take the mean cost and the highest raised height of
// their pixels. Scene 1 alone sees the lines below `onlyOne`; no scene sees the last column.
// With `garbled`, a read that says which cells it needs gets costs, greys and raised heights
// that would move the seams everywhere else (and greys of 0, no colour term, where needed).
class FieldSource : public SeamSource {
  public:
    FieldSource(Field f, int pixels, int lines) : f_(f), pixels_(pixels), lines_(lines) {}

    SeamWindow Read(int x0, int y0, int width, int height, int factor) override {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            largest = std::max({largest, width, height});
        }
        SeamWindow w;
        w.width = width;
        w.height = height;
        w.scenes = {0, 1};
        w.cost.assign(2, {});
        for (int y = 0; y < height; ++y)
            for (int x = 0; x < width; ++x) {
                double sum[2] = {0, 0}, raised = 0;
                int seen[2] = {0, 0};
                for (int py = (y0 + y) * factor; py < std::min(lines_, (y0 + y + 1) * factor); ++py)
                    for (int px = (x0 + x) * factor; px < std::min(pixels_, (x0 + x + 1) * factor);
                         ++px) {
                        raised = std::max(raised, f_.Raised(px + 0.5, py + 0.5));
                        for (int k = 0; k < 2; ++k)
                            if (Sees(k, px, py))
                                sum[k] += f_.Cost(k, px + 0.5) + noise * Noise(px, py, k),
                                    ++seen[k];
                    }
                for (int k = 0; k < 2; ++k)
                    w.cost[k].push_back(seen[k] > 0 ? static_cast<float>(sum[k] / seen[k])
                                                    : kForbidden);
                w.raised.push_back(static_cast<float>(raised));
            }
        return w;
    }

    SeamWindow Read(int x0, int y0, int width, int height, int factor,
                    const CellsNeeded& needed) override {
        SeamWindow w = Read(x0, y0, width, height, factor);
        if (!garbled)
            return w;
        SeamWindow allowed = w;
        for (std::vector<float>& cost : allowed.cost)
            for (float& c : cost)
                c = c < kForbidden ? 0.0f : kForbidden;
        allowed.raised.clear();
        const std::vector<std::uint8_t> full = needed(allowed);
        EXPECT_EQ(full.size(), w.cost[0].size());
        std::mt19937 rng(static_cast<unsigned>(x0 * 7919 + y0));
        std::uniform_real_distribution<float> garbage(0.0f, 50.0f);
        w.grey.assign(2, std::vector<float>(full.size(), 0.0f));
        for (std::size_t c = 0; c < full.size(); ++c) {
            if (full[c])
                continue;
            for (int k = 0; k < 2; ++k) {
                if (w.cost[k][c] < kForbidden)
                    w.cost[k][c] = garbage(rng);
                w.grey[k][c] = 1000 * garbage(rng);
            }
            w.raised[c] = 100 * garbage(rng);
        }
        std::lock_guard<std::mutex> lock(mutex_);
        neededCells += static_cast<std::size_t>(std::count(full.begin(), full.end(), 1));
        readCells += full.size();
        return w;
    }

    bool Sees(int scene, int x, int y) const {
        return x + 1 < pixels_ && (scene == 1 || y < onlyOne);
    }
    // A fixed pseudo-random value in [0, 1) per pixel and scene.
    static float Noise(int x, int y, int k) {
        std::uint32_t h = static_cast<std::uint32_t>(x) * 73856093u ^
                          static_cast<std::uint32_t>(y) * 19349663u ^
                          static_cast<std::uint32_t>(k) * 83492791u;
        h ^= h >> 13, h *= 0x5bd1e995u, h ^= h >> 15;
        return static_cast<float>(h % 1000) / 1000.0f;
    }

    int onlyOne = 0;
    float noise = 0;  // added to each pixel's cost, times Noise
    int largest = 0;
    bool garbled = false;
    std::size_t neededCells = 0, readCells = 0;

  private:
    Field f_;
    int pixels_, lines_;
    std::mutex mutex_;
};

TEST(ChooseRegions, TilesMeetAlongOneSeamAroundRaisedGround) {
    // 5 x 4 full-resolution tiles of 64, a coarse grid of several blocks.
    const int pixels = 300, lines = 250;
    Field f;
    f.width = pixels;
    f.crossing = pixels / 2.0;
    f.blockX0 = 130, f.blockX1 = 175, f.blockY0 = 70, f.blockY1 = 150;
    FieldSource source(f, pixels, lines);
    source.onlyOne = 220;
    SeamParams params;
    params.tile = 64;

    // Every pixel handed once, in windows of at most a tile; the same on any number of threads.
    // Progress rises over the passes to the end of the run's span.
    auto choose = [&](unsigned int threads) {
        std::vector<std::uint16_t> labels(static_cast<std::size_t>(pixels) * lines, 0xffff);
        int windows = 0;
        std::vector<double> fractions;
        RunControl control(
            nullptr,
            [](double fraction, const char*, void* data) {
                static_cast<std::vector<double>*>(data)->push_back(fraction);
                return true;
            },
            &fractions);
        control.SetSpan(0.5, 0.25);
        ChooseRegions(source, pixels, lines, params, threads, control,
                      [&](int x0, int y0, int w, int h, const std::vector<std::uint16_t>& out) {
                          ++windows;
                          EXPECT_TRUE(w <= params.tile && h <= params.tile);
                          ASSERT_EQ(out.size(), static_cast<std::size_t>(w) * h);
                          for (int y = 0; y < h; ++y)
                              for (int x = 0; x < w; ++x) {
                                  std::uint16_t& l = labels[Index(x0 + x, y0 + y, pixels)];
                                  EXPECT_EQ(l, 0xffff)
                                      << "pixel " << x0 + x << ", " << y0 + y << " handed twice";
                                  l = out[Index(x, y, w)];
                              }
                      });
        EXPECT_EQ(windows, 5 * 4);
        EXPECT_TRUE(std::is_sorted(fractions.begin(), fractions.end()));
        EXPECT_EQ(fractions.front(), 0.5);
        EXPECT_DOUBLE_EQ(fractions.back(), 0.75);
        EXPECT_EQ(control.SpanStart(), 0.5);
        return labels;
    };
    const std::vector<std::uint16_t> labels = choose(2);
    EXPECT_EQ(choose(1), labels);
    EXPECT_LE(source.largest, params.tile + 2);
    // The refinement reads in full only the cells it may relabel and their neighbours: the same
    // labels whatever the rest holds, also where noisy costs make ragged seams.
    for (const float noise : {0.0f, 2.0f}) {
        source.noise = noise;
        source.garbled = false;
        const std::vector<std::uint16_t> plain = choose(2);
        source.garbled = true;
        EXPECT_EQ(choose(2), plain) << "noise " << noise;
    }
    EXPECT_GT(source.neededCells, 0u);
    EXPECT_LT(source.neededCells, source.readCells / 4);
    source.noise = 0, source.garbled = false;

    std::vector<float> raised;
    for (int y = 0; y < lines; ++y)
        for (int x = 0; x < pixels; ++x)
            raised.push_back(static_cast<float>(f.Raised(x + 0.5, y + 0.5)));
    // The last column, seen by no scene, is 0; where only scene 1 sees, it is 2.
    for (int y = 0; y < lines; ++y) {
        EXPECT_EQ(labels[Index(pixels - 1, y, pixels)], 0) << "line " << y;
        for (int x = 0; y >= source.onlyOne && x + 1 < pixels; ++x)
            ASSERT_EQ(labels[Index(x, y, pixels)], 2) << x << ", " << y;
    }
    // Above, one seam from top to bottom, never over the block, near the crossing elsewhere.
    std::vector<std::uint16_t> seen(labels.begin(), labels.begin() + source.onlyOne * pixels);
    for (std::size_t c = 0; c < seen.size(); ++c)
        if (c % pixels == static_cast<std::size_t>(pixels - 1))
            seen[c] = seen[c - 1];
    const SeamTrace t = Trace(seen, raised, pixels, source.onlyOne);
    EXPECT_EQ(t.onRaised, 0);
    for (int y = 0; y < source.onlyOne; ++y) {
        ASSERT_EQ(t.changes[y].size(), 1u) << "line " << y;
        const int x = t.changes[y][0];
        EXPECT_EQ(labels[Index(x, y, pixels)], 1) << "line " << y;
        if (y < f.blockY0 - 1 || y > f.blockY1) {
            EXPECT_NEAR(x + 1, f.crossing, CoarseFactor(pixels, lines, params.pixelSize))
                << "line " << y;
        }
    }
}

// Raised heights by their definition: the heights minus the largest over the square of the
// smallest heights over the square, missing heights left out.
std::vector<float> RaisedByDefinition(const std::vector<float>& h, int width, int height, int r) {
    auto square = [&](const std::vector<float>& in, bool smallest) {
        std::vector<float> out(in.size());
        for (int y = 0; y < height; ++y)
            for (int x = 0; x < width; ++x) {
                float v = NAN;
                for (int yy = std::max(0, y - r); yy <= std::min(height - 1, y + r); ++yy)
                    for (int xx = std::max(0, x - r); xx <= std::min(width - 1, x + r); ++xx) {
                        const float s = in[Index(xx, yy, width)];
                        if (!std::isnan(s))
                            v = std::isnan(v) ? s : smallest ? std::min(v, s) : std::max(v, s);
                    }
                out[Index(x, y, width)] = v;
            }
        return out;
    };
    const std::vector<float> opened = square(square(h, true), false);
    std::vector<float> raised(h.size(), 0.0f);
    for (std::size_t c = 0; c < h.size(); ++c)
        if (!std::isnan(h[c]))
            raised[c] = h[c] - opened[c];
    return raised;
}

TEST(RaisedHeights, MatchesTheOpeningWithMissingHeights) {
    struct Case {
        int width, height, radius;
    };
    const Case cases[] = {{17, 11, 2}, {9, 23, 4}, {5, 4, 7}, {12, 1, 3}, {8, 8, 0}};
    std::mt19937 rng(7);
    std::uniform_real_distribution<float> unit(0.0f, 1.0f);
    for (const Case& k : cases) {
        SCOPED_TRACE(::testing::Message() << k.width << "x" << k.height << " radius " << k.radius);
        std::vector<float> h;
        for (int c = 0; c < k.width * k.height; ++c)
            h.push_back(unit(rng) < 0.2f ? NAN : 100 + 20 * unit(rng));
        EXPECT_EQ(RaisedHeights(h, k.width, k.height, k.radius),
                  RaisedByDefinition(h, k.width, k.height, k.radius));
    }
    EXPECT_THROW(RaisedHeights(std::vector<float>(5), 2, 2, 1), kestrel::DataException);
}

}  // namespace
