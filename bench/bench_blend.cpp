// Blending one 512 x 512 mosaic tile of three channels (with the border each mode needs) on one
// thread: hard seams, feather and multiband, for 2 to 4 scenes whose regions meet in seams
// across the tile, and a tile inside one region. Reports megapixels of the inner tile per second.
//
//   bench_blend [--benchmark_filter=...]
#include "../platform/src/trueortho/blend.h"

#include <benchmark/benchmark.h>

#include <cmath>
#include <random>

namespace {

using namespace kestrel::processes::trueortho;

constexpr int kSize = 512, kBands = 3, kWidth = 16;

// Regions of the scenes' nearest centres (a scene's centres spread over the tile), textured
// values, and a tenth of each scene unseen in rectangles.
BlendTile MakeTile(int scenes, BlendMode mode) {
    BlendTile t;
    t.border = BlendBorder(mode, kWidth);
    t.width = t.height = kSize + 2 * t.border;
    t.bands = kBands;
    const std::size_t full = static_cast<std::size_t>(t.width) * t.height;
    std::mt19937 random(3);
    std::uniform_real_distribution<float> noise(0.0f, 30.0f);
    std::uniform_int_distribution<int> at(0, t.width - 1), side(4, 24);
    for (int k = 0; k < scenes; ++k) {
        t.scenes.push_back(static_cast<std::size_t>(k));
        t.values.emplace_back(full * kBands);
        for (float& v : t.values.back())
            v = 60.0f + 40.0f * k + noise(random);
        t.seen.emplace_back(full, 1);
        for (std::size_t hidden = 0; hidden < full / 10;) {
            const int x = at(random), y = at(random), w = side(random), h = side(random);
            for (int j = y; j < std::min(t.height, y + h); ++j)
                for (int i = x; i < std::min(t.width, x + w); ++i) {
                    unsigned char& s = t.seen[k][static_cast<std::size_t>(j) * t.width + i];
                    hidden += s;
                    s = 0;
                }
        }
    }
    const double cx[] = {0.2, 0.8, 0.3, 0.7}, cy[] = {0.3, 0.7, 0.8, 0.2};
    t.labels.resize(full);
    for (int y = 0; y < t.height; ++y)
        for (int x = 0; x < t.width; ++x) {
            int best = 0;
            double nearest = 1e300;
            for (int k = 0; k < scenes; ++k) {
                const double d = std::hypot(x - cx[k] * t.width, y - cy[k] * t.height);
                if (d < nearest)
                    nearest = d, best = k;
            }
            t.labels[static_cast<std::size_t>(y) * t.width + x] = best;
        }
    return t;
}

void Blend(benchmark::State& state, BlendMode mode, int width) {
    const BlendTile tile = MakeTile(static_cast<int>(state.range(0)), mode);
    std::vector<float> out;
    for (auto _ : state) {
        BlendRegions(tile, mode, width, 0.0f, out);
        benchmark::DoNotOptimize(out.data());
    }
    state.counters["MP/s"] = benchmark::Counter(static_cast<double>(kSize) * kSize / 1e6,
                                                benchmark::Counter::kIsIterationInvariantRate);
}

void Hard(benchmark::State& state) {
    Blend(state, BlendMode::Feather, 0);
}
void Feather(benchmark::State& state) {
    Blend(state, BlendMode::Feather, kWidth);
}
void Multiband(benchmark::State& state) {
    Blend(state, BlendMode::Multiband, kWidth);
}

BENCHMARK(Hard)->Arg(1)->Arg(4)->Unit(benchmark::kMillisecond);
BENCHMARK(Feather)->Arg(1)->Arg(2)->Arg(3)->Arg(4)->Unit(benchmark::kMillisecond);
BENCHMARK(Multiband)->Arg(1)->Arg(2)->Arg(3)->Arg(4)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
