// Seamlines: the solver on one window, and the region chooser over a 4096 x 4096 grid of a
// synthetic survey (4 or 6 overlapping scenes, 0.1 m pixels, flat-roofed blocks hiding ground
// behind them), beside the cost of reading the survey's windows alone.
#include "../platform/src/trueortho/runcontrol.h"
#include "../platform/src/trueortho/seams.h"

#include <benchmark/benchmark.h>

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <vector>

using namespace kestrel::processes::trueortho;

namespace {

constexpr int kGrid = 4096;
constexpr double kPixel = 0.1;         // metres
constexpr double kFlyingHeight = 300;  // metres
constexpr double kBlockPitch = 40, kBlockSide = 16, kBlockHeight = 10;

// Metres the blocks stand above the ground at (x, y) metres.
double Height(double x, double y) {
    const double u = std::fmod(x, kBlockPitch), v = std::fmod(y, kBlockPitch);
    return u < kBlockSide && v < kBlockSide ? kBlockHeight : 0;
}

// Seam pixels along lines (label changes between neighbours on a line), and how many of them
// touch a block. Blocks hide ground next to them, so many seams must run along their edges.
struct SeamCount {
    std::uint64_t all = 0, raised = 0;
    void Add(int x0, int y0, int w, int h, const std::vector<std::uint16_t>& labels) {
        for (int y = 0; y < h; ++y)
            for (int x = 0; x + 1 < w; ++x)
                if (labels[static_cast<std::size_t>(y) * w + x] !=
                    labels[static_cast<std::size_t>(y) * w + x + 1]) {
                    ++all;
                    const double my = (y0 + y + 0.5) * kPixel;
                    raised += Height((x0 + x + 0.5) * kPixel, my) > 0 ||
                              Height((x0 + x + 1.5) * kPixel, my) > 0;
                }
    }
    void Report(benchmark::State& state) const {
        state.counters["seam px/line"] = static_cast<double>(all) / state.iterations() / kGrid;
        state.counters["on blocks px/line"] =
            static_cast<double>(raised) / state.iterations() / kGrid;
    }
};

// Scenes with their nadirs spread over the grid, each seeing a square of 70 % of its side.
class Survey : public SeamSource {
  public:
    explicit Survey(int scenes) {
        const double side = kGrid * kPixel;
        for (int k = 0; k < scenes; ++k) {
            const int columns = scenes / 2;
            nadirs_.push_back(
                {side * (k % columns + 0.5) / columns, side * (k / columns + 0.5) / 2});
        }
        reach_ = 0.35 * side;
    }

    SeamWindow Read(int x0, int y0, int width, int height, int factor) override {
        SeamWindow w;
        w.width = width;
        w.height = height;
        const std::size_t cells = static_cast<std::size_t>(width) * height;
        for (std::size_t k = 0; k < nadirs_.size(); ++k) {
            w.scenes.push_back(k);
            w.cost.emplace_back(cells);
            w.grey.emplace_back(cells);
        }
        w.raised.resize(cells);
        for (int y = 0; y < height; ++y)
            for (int x = 0; x < width; ++x) {
                // Cells are sampled at their centre pixel.
                const double mx = ((x0 + x) * factor + factor / 2 + 0.5) * kPixel;
                const double my = ((y0 + y) * factor + factor / 2 + 0.5) * kPixel;
                const std::size_t c = static_cast<std::size_t>(y) * width + x;
                w.raised[c] = static_cast<float>(Height(mx, my));
                for (std::size_t k = 0; k < nadirs_.size(); ++k) {
                    w.cost[k][c] = Sees(k, mx, my, w.raised[c])
                                       ? static_cast<float>(Distance(k, mx, my) / kFlyingHeight)
                                       : kForbidden;
                    w.grey[k][c] =
                        static_cast<float>(90 + 8 * k + 30 * std::sin(mx) * std::cos(my));
                }
            }
        return w;
    }

  private:
    struct Point {
        double x, y;
    };
    double Distance(std::size_t k, double x, double y) const {
        return std::hypot(x - nadirs_[k].x, y - nadirs_[k].y);
    }
    // Within the footprint and not behind a block: a few points on the way to the camera.
    bool Sees(std::size_t k, double x, double y, double height) const {
        const Point n = nadirs_[k];
        if (std::fabs(x - n.x) > reach_ || std::fabs(y - n.y) > reach_)
            return false;
        const double d = Distance(k, x, y);
        if (height > 0 || d < 1e-9)
            return true;
        const double shadow = kBlockHeight * d / kFlyingHeight;
        for (double s : {0.25, 0.5, 1.0})
            if (Height(x + (n.x - x) / d * shadow * s, y + (n.y - y) / d * shadow * s) > 0)
                return false;
        return true;
    }

    std::vector<Point> nadirs_;
    double reach_ = 0;
};

SeamParams Params() {
    SeamParams p;
    p.pixelSize = kPixel;
    return p;
}

// One window of 512 x 512 cells, reduced `factor` times, where the scenes overlap most (the
// middle of the grid), all cells free.
void BM_SolveSeams(benchmark::State& state) {
    Survey survey(static_cast<int>(state.range(0)));
    const int factor = static_cast<int>(state.range(1));
    const int x0 = (kGrid / factor - 512) / 2;
    const SeamWindow window = survey.Read(x0, x0, 512, 512, factor);
    SeamParams params = Params();
    params.pixelSize *= factor;
    for (auto _ : state)
        benchmark::DoNotOptimize(SolveSeams(window, params));
    state.SetItemsProcessed(state.iterations() * 512 * 512);
    state.counters["cells/s"] =
        benchmark::Counter(512.0 * 512, benchmark::Counter::kIsIterationInvariantRate);
}
BENCHMARK(BM_SolveSeams)
    ->ArgNames({"scenes", "factor"})
    ->Args({4, 8})
    ->Args({6, 8})
    ->Args({6, 1})
    ->Unit(benchmark::kMillisecond);

void BM_ChooseRegions(benchmark::State& state) {
    Survey survey(static_cast<int>(state.range(0)));
    const unsigned int threads = static_cast<unsigned int>(state.range(1));
    SeamCount seams;
    for (auto _ : state) {
        RunControl control(nullptr, nullptr, nullptr);
        ChooseRegions(survey, kGrid, kGrid, Params(), threads, control,
                      [&](int x0, int y0, int w, int h, const std::vector<std::uint16_t>& l) {
                          seams.Add(x0, y0, w, h, l);
                      });
    }
    state.counters["cells/s"] = benchmark::Counter(static_cast<double>(kGrid) * kGrid,
                                                   benchmark::Counter::kIsIterationInvariantRate);
    seams.Report(state);
}
BENCHMARK(BM_ChooseRegions)
    ->ArgNames({"scenes", "threads"})
    ->Args({4, 1})
    ->Args({6, 1})
    ->Args({6, 2})
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime()
    ->Iterations(1);

// The same grid's full-resolution windows read and labelled with their cheapest scene: the
// per-pixel choice that seamlines replace, and the part of the time the source takes.
void BM_CheapestScene(benchmark::State& state) {
    Survey survey(static_cast<int>(state.range(0)));
    SeamCount seams;
    for (auto _ : state)
        for (int y0 = 0; y0 < kGrid; y0 += 512)
            for (int x0 = 0; x0 < kGrid; x0 += 512) {
                const SeamWindow w = survey.Read(x0, y0, 512, 512, 1);
                std::vector<std::uint16_t> best(512 * 512, 0);
                for (std::size_t c = 0; c < best.size(); ++c) {
                    float least = kForbidden;
                    for (std::size_t k = 0; k < w.scenes.size(); ++k)
                        if (w.cost[k][c] < least)
                            least = w.cost[k][c], best[c] = static_cast<std::uint16_t>(k + 1);
                }
                seams.Add(x0, y0, 512, 512, best);
            }
    state.counters["cells/s"] = benchmark::Counter(static_cast<double>(kGrid) * kGrid,
                                                   benchmark::Counter::kIsIterationInvariantRate);
    seams.Report(state);
}
BENCHMARK(BM_CheapestScene)
    ->ArgName("scenes")
    ->Arg(6)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime()
    ->Iterations(1);

}  // namespace

BENCHMARK_MAIN();
