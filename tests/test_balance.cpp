// Colour balancing on synthetic overlap samples: scenes that record one radiance through
// exposures of their own are brought back into agreement, keeping the survey's mean; and inputs
// that determine little still give finite, sane fits.
#include "../platform/src/trueortho/balance.h"

#include "support.h"

#include <cmath>
#include <functional>
#include <random>
#include <string>
#include <utility>
#include <vector>

namespace {

using namespace kestrel::processes::trueortho;

// Scene s records radiance t in channel c as gain[s][c] * t + offset[s][c].
struct Exposure {
    std::vector<std::vector<double>> gain, offset;
    double Record(std::size_t s, int c, double t) const { return gain[s][c] * t + offset[s][c]; }
};

// `count` samples of each pair of scenes in two channels: radiance uniform in [20, 230], noise
// of +-1 grey level, and a share `outliers` of samples whose value in scene b is anything (a car
// that moved, an edge a pixel off).
std::vector<OverlapSamples> Samples(const Exposure& exposure,
                                    const std::vector<std::pair<int, int>>& pairs, int count,
                                    double outliers) {
    std::mt19937 random(7);
    std::uniform_real_distribution<double> radiance(20, 230), noise(-1, 1), any(0, 255), u(0, 1);
    std::vector<OverlapSamples> overlaps;
    for (const auto& [a, b] : pairs) {
        OverlapSamples o;
        o.a = a, o.b = b;
        for (int k = 0; k < count; ++k)
            for (int c = 0; c < 2; ++c) {
                const double t = radiance(random);
                o.valuesA.push_back(static_cast<float>(exposure.Record(a, c, t) + noise(random)));
                o.valuesB.push_back(static_cast<float>(
                    u(random) < outliers ? any(random) : exposure.Record(b, c, t) + noise(random)));
            }
        overlaps.push_back(std::move(o));
    }
    return overlaps;
}

// The sample-weighted means of the raw and the corrected values of channel c.
std::pair<double, double> Means(const std::vector<OverlapSamples>& overlaps, const BalanceFit& fit,
                                int c) {
    double raw = 0, corrected = 0, n = 0;
    for (const OverlapSamples& o : overlaps)
        for (std::size_t i = c; i < o.valuesA.size(); i += 2)
            for (const auto& [s, v] :
                 {std::make_pair(o.a, o.valuesA[i]), std::make_pair(o.b, o.valuesB[i])})
                if (std::isfinite(v))
                    raw += v, corrected += fit.gain[s][c] * v + fit.offset[s][c], n += 1;
    return {raw / n, corrected / n};
}

std::vector<std::pair<int, int>> Chain(int scenes) {
    std::vector<std::pair<int, int>> pairs;
    for (int s = 0; s + 1 < scenes; ++s)
        pairs.emplace_back(s, s + 1);
    return pairs;
}

TEST(Balance, RecoversExposuresUpToTheAnchoringAndKeepsTheMean) {
    const Exposure fourScenes{{{1.0, 0.9}, {1.2, 1.1}, {0.8, 0.85}, {1.1, 1.0}},
                              {{0, 4}, {-10, 0}, {12, 6}, {3, -8}}};
    const Exposure gainsOnly{{{1.0, 0.9}, {1.2, 1.1}, {0.8, 0.85}, {1.1, 1.0}},
                             {{0, 0}, {0, 0}, {0, 0}, {0, 0}}};
    Exposure strip;  // forty scenes, exposures drifting along the strip
    for (int s = 0; s < 40; ++s) {
        strip.gain.push_back({1.0 + 0.2 * std::sin(s * 0.4), 1.0 - 0.15 * std::cos(s * 0.3)});
        strip.offset.push_back({5.0 * std::cos(s * 0.5), -4.0 * std::sin(s * 0.2)});
    }
    const std::vector<std::pair<int, int>> all{{0, 1}, {0, 2}, {0, 3}, {1, 2}, {1, 3}, {2, 3}};
    struct Case {
        std::string name;
        const Exposure& exposure;
        std::vector<std::pair<int, int>> pairs;
        BalanceMode mode;
        std::size_t denseLimit;
        double ends;  // grey levels between the first and the last scene: errors add up a chain
    };
    const std::vector<Case> cases{
        {"four scenes, every pair, gain and offset", fourScenes, all, BalanceMode::GainOffset, 400,
         0.75},
        {"chain of three (0 and 2 do not meet)", fourScenes, Chain(3), BalanceMode::GainOffset, 400,
         1},
        {"four scenes, gains", gainsOnly, all, BalanceMode::Gain, 100, 0.75},
        {"chain of three, gains", gainsOnly, Chain(3), BalanceMode::Gain, 100, 1},
        {"strip of forty, conjugate gradients", strip, Chain(40), BalanceMode::GainOffset, 0, 6},
        {"strip of forty, dense", strip, Chain(40), BalanceMode::GainOffset, 100, 6}};
    for (const Case& test : cases) {
        SCOPED_TRACE(test.name);
        const std::vector<OverlapSamples> overlaps = Samples(test.exposure, test.pairs, 1000, 0.05);
        BalanceParams params;
        params.denseLimit = test.denseLimit;
        const BalanceFit fit =
            FitBalance(test.exposure.gain.size(), 2, overlaps, test.mode, params);
        for (int c = 0; c < 2; ++c) {
            // Every pair of fitted scenes turns one radiance into one value, dark or bright.
            for (const double t : {20.0, 230.0}) {
                auto corrected = [&](std::size_t s) {
                    return fit.gain[s][c] * test.exposure.Record(s, c, t) + fit.offset[s][c];
                };
                for (const auto& [a, b] : test.pairs)
                    EXPECT_NEAR(corrected(a), corrected(b), 0.75) << a << "-" << b << " c" << c;
                EXPECT_NEAR(corrected(test.pairs.front().first),
                            corrected(test.pairs.back().second), test.ends);
            }
            const auto [raw, corrected] = Means(overlaps, fit, c);
            EXPECT_NEAR(corrected, raw, 1e-6 * raw);
            for (std::size_t s = 0; s < fit.offset.size() && test.mode == BalanceMode::Gain; ++s)
                EXPECT_EQ(fit.offset[s][c], 0.0);
        }
    }
}

TEST(Balance, InputsThatDetermineLittleGiveFiniteSaneFits) {
    auto constant = [](std::size_t a, std::size_t b, float va, float vb, int n) {
        OverlapSamples o;
        o.a = a, o.b = b, o.valuesA.assign(n, va), o.valuesB.assign(n, vb);
        return o;
    };
    const float nan = std::nanf("");
    const Exposure exposure{{{1.0, 1.0}, {1.2, 1.2}}, {{0, 0}, {-10, -10}}};
    const std::vector<OverlapSamples> clean = Samples(exposure, {{0, 1}}, 200, 0.0);
    std::vector<OverlapSamples> withNaN = clean;  // the clean samples, each beside an unusable one
    for (OverlapSamples& o : withNaN)
        for (std::size_t i = 0, n = o.valuesA.size(); i < n; ++i)
            o.valuesA.push_back(i % 2 ? nan : o.valuesA[i]), o.valuesB.push_back(i % 2 ? 5 : nan);
    const BalanceFit cleanFit = FitBalance(2, 2, clean, BalanceMode::GainOffset);
    const auto identity = [](const BalanceFit& fit, std::size_t s) {
        for (std::size_t c = 0; c < fit.gain[s].size(); ++c)
            EXPECT_TRUE(fit.gain[s][c] == 1.0 && fit.offset[s][c] == 0.0) << "scene " << s;
    };
    struct Case {
        std::string name;
        std::size_t scenes;
        int bands;
        std::vector<OverlapSamples> overlaps;
        BalanceMode mode;
        std::function<void(const BalanceFit&)> check;
    };
    const std::vector<Case> cases{
        {"no balance asked", 2, 2, clean, BalanceMode::None,
         [&](const BalanceFit& f) { identity(f, 0), identity(f, 1); }},
        {"one scene",
         1,
         2,
         {},
         BalanceMode::GainOffset,
         [&](const BalanceFit& f) { identity(f, 0); }},
        {"constant images meet at their mean",
         2,
         1,
         {constant(0, 1, 100, 120, 50)},
         BalanceMode::GainOffset,
         [](const BalanceFit& f) {
             EXPECT_NEAR(f.gain[0][0] * 100 + f.offset[0][0], 110, 0.5);
             EXPECT_NEAR(f.gain[1][0] * 120 + f.offset[1][0], 110, 0.5);
             EXPECT_NEAR(f.gain[0][0], 1.0, 0.1);
         }},
        {"black images, gains",
         2,
         1,
         {constant(0, 1, 0, 0, 50)},
         BalanceMode::Gain,
         [&](const BalanceFit& f) { identity(f, 0), identity(f, 1); }},
        {"unusable samples are left out", 2, 2, withNaN, BalanceMode::GainOffset,
         [&](const BalanceFit& f) {
             for (std::size_t s = 0; s < 2; ++s)
                 for (int c = 0; c < 2; ++c) {
                     EXPECT_NEAR(f.gain[s][c], cleanFit.gain[s][c], 1e-9);
                     EXPECT_NEAR(f.offset[s][c], cleanFit.offset[s][c], 1e-6);
                 }
         }},
        {"only unusable samples, a scene with itself, a scene without samples",
         3,
         1,
         {constant(0, 1, nan, 100, 20), constant(1, 1, 50, 80, 20), constant(0, 2, 40, nan, 9)},
         BalanceMode::GainOffset,
         [&](const BalanceFit& f) { identity(f, 0), identity(f, 1), identity(f, 2); }},
        {"a scene without samples beside a fitted pair", 3, 2, clean, BalanceMode::GainOffset,
         [&](const BalanceFit& f) {
             EXPECT_GT(std::abs(f.gain[1][0] - 1.0), 0.05);
             identity(f, 2);
         }},
    };
    for (const Case& test : cases) {
        SCOPED_TRACE(test.name);
        const BalanceFit fit = FitBalance(test.scenes, test.bands, test.overlaps, test.mode);
        ASSERT_EQ(fit.gain.size(), test.scenes);
        for (std::size_t s = 0; s < test.scenes; ++s)
            for (int c = 0; c < test.bands; ++c)
                EXPECT_TRUE(std::isfinite(fit.offset[s][c]) && fit.gain[s][c] > 0.0);
        test.check(fit);
    }
}

TEST(Balance, RefusesOverlapsThatDoNotFit) {
    OverlapSamples beyond, uneven, partial;
    beyond.a = 0, beyond.b = 2, beyond.valuesA = beyond.valuesB = {1, 2};
    uneven.a = 0, uneven.b = 1, uneven.valuesA = {1, 2}, uneven.valuesB = {1, 2, 3, 4};
    partial.a = 0, partial.b = 1, partial.valuesA = partial.valuesB = {1, 2, 3};
    for (const OverlapSamples& o : {beyond, uneven, partial}) {
        const std::string message = testsupport::ThrownMessage<kestrel::DataException>(
            [&] { FitBalance(2, 2, {o}, BalanceMode::GainOffset); });
        EXPECT_TRUE(testsupport::Contains(message, "overlap 0 of scenes 0 and")) << message;
    }
}

}  // namespace
