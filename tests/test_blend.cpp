// Blending across seams on synthetic mosaics: hard seams, the feather ramp, scenes that do not
// see the ground, and tiles that agree with each other.
#include "../platform/src/trueortho/blend.h"

#include <kestrel/exception.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <random>

namespace {

using namespace kestrel::processes::trueortho;

constexpr float kNoData = -9999.0f;

// Scenes over a whole grid: values (bands planes), visibility and the region of each pixel.
struct Mosaic {
    int width = 0, height = 0, bands = 1;
    std::vector<std::vector<float>> values;
    std::vector<std::vector<unsigned char>> seen;
    std::vector<int> labels;

    Mosaic(int w, int h, int b, int scenes)
        : width(w),
          height(h),
          bands(b),
          values(scenes, std::vector<float>(static_cast<std::size_t>(w) * h * b)),
          seen(scenes, std::vector<unsigned char>(static_cast<std::size_t>(w) * h, 1)),
          labels(static_cast<std::size_t>(w) * h, 0) {}
    std::size_t At(int x, int y) const { return static_cast<std::size_t>(y) * width + x; }

    // The tile of inner size w x h at (x0, y0) with a border; outside the grid nothing is seen.
    // `reversed` lists the scenes last to first.
    BlendTile Tile(int x0, int y0, int w, int h, int border, bool reversed = false) const {
        BlendTile t;
        t.width = w + 2 * border, t.height = h + 2 * border, t.border = border, t.bands = bands;
        t.x0 = x0, t.y0 = y0;
        const int n = static_cast<int>(values.size());
        const std::size_t full = static_cast<std::size_t>(t.width) * t.height;
        for (int k = 0; k < n; ++k) {
            t.scenes.push_back(static_cast<std::size_t>(reversed ? n - 1 - k : k));
            t.values.emplace_back(full * bands, 0.0f);
            t.seen.emplace_back(full, 0);
        }
        t.labels.assign(full, -1);
        for (int y = 0; y < t.height; ++y)
            for (int x = 0; x < t.width; ++x) {
                const int gx = x0 - border + x, gy = y0 - border + y;
                if (gx < 0 || gy < 0 || gx >= width || gy >= height)
                    continue;
                const std::size_t p = static_cast<std::size_t>(y) * t.width + x;
                const int label = labels[At(gx, gy)];
                for (int k = 0; k < n; ++k) {
                    const int s = static_cast<int>(t.scenes[k]);
                    if (label == s)
                        t.labels[p] = k;
                    t.seen[k][p] = seen[s][At(gx, gy)];
                    for (int b = 0; b < bands; ++b)
                        t.values[k][full * b + p] =
                            values[s][static_cast<std::size_t>(width) * height * b + At(gx, gy)];
                }
            }
        return t;
    }

    // The blended grid, tile by tile.
    std::vector<float> Blend(BlendMode mode, int blendWidth, int tile,
                             bool reversed = false) const {
        const int border = BlendBorder(mode, blendWidth);
        const std::size_t plane = static_cast<std::size_t>(width) * height;
        std::vector<float> grid(plane * bands), out;
        for (int y0 = 0; y0 < height; y0 += tile)
            for (int x0 = 0; x0 < width; x0 += tile) {
                const int w = std::min(tile, width - x0), h = std::min(tile, height - y0);
                BlendRegions(Tile(x0, y0, w, h, border, reversed), mode, blendWidth, kNoData, out);
                for (int b = 0; b < bands; ++b)
                    for (int y = 0; y < h; ++y)
                        for (int x = 0; x < w; ++x)
                            grid[plane * b + At(x0 + x, y0 + y)] =
                                out[static_cast<std::size_t>(w) * h * b +
                                    static_cast<std::size_t>(y) * w + x];
            }
        return grid;
    }
};

// Three textured scenes of two bands with Voronoi regions, a corner no scene sees and blobs
// that some scenes do not see.
Mosaic Patchwork() {
    Mosaic m(240, 160, 2, 3);
    std::mt19937 random(7);
    std::uniform_real_distribution<float> noise(-20.0f, 20.0f);
    const int cx[] = {30, 120, 70}, cy[] = {20, 40, 95};
    for (int y = 0; y < m.height; ++y)
        for (int x = 0; x < m.width; ++x) {
            const std::size_t p = m.At(x, y);
            int best = 0;
            for (int k = 1; k < 3; ++k)
                if (std::hypot(x - cx[k], y - cy[k]) < std::hypot(x - cx[best], y - cy[best]))
                    best = k;
            m.labels[p] = x + y < 12 ? -1 : best;
            for (int k = 0; k < 3; ++k) {
                m.seen[k][p] = std::hypot(x - 60 - 20 * k, y - 50) < 6 + 2 * k ? 0 : 1;
                for (int b = 0; b < 2; ++b)
                    m.values[k][m.width * m.height * b + p] =
                        60.0f * (k + 1) + 20.0f * b + noise(random);
            }
        }
    return m;
}

// Scene 0 of value 0 left of column `seam`, scene 1 of value 100 from it on.
Mosaic StraightSeam(int seam) {
    Mosaic m(64, 4, 1, 2);
    for (int y = 0; y < m.height; ++y)
        for (int x = 0; x < m.width; ++x) {
            m.labels[m.At(x, y)] = x < seam ? 0 : 1;
            m.values[1][m.At(x, y)] = 100.0f;
        }
    return m;
}

TEST(Blend, HardSeamsAreTheRegionsValuesExactly) {
    const Mosaic m = Patchwork();
    std::vector<float> regions(m.values[0].size());
    const std::size_t plane = static_cast<std::size_t>(m.width) * m.height;
    for (std::size_t p = 0; p < plane; ++p)
        for (int b = 0; b < m.bands; ++b)
            regions[plane * b + p] =
                m.labels[p] < 0 ? kNoData : m.values[m.labels[p]][plane * b + p];
    const struct {
        BlendMode mode;
        int width, tile;
    } cases[] = {
        {BlendMode::Feather, 0, 64}, {BlendMode::Multiband, 0, 40}, {BlendMode::Multiband, 1, 64}};
    for (const auto& c : cases)
        EXPECT_EQ(m.Blend(c.mode, c.width, c.tile), regions) << c.width;

    // A tile in one region copies it, whatever the width.
    Mosaic one = m;
    std::replace(one.labels.begin(), one.labels.end(), 2, 1);
    std::replace(one.labels.begin(), one.labels.end(), 0, 1);
    std::vector<float> out;
    BlendRegions(one.Tile(100, 60, 32, 32, 9), BlendMode::Feather, 16, kNoData, out);
    for (int y = 0; y < 32; ++y)
        for (int x = 0; x < 32; ++x)
            ASSERT_EQ(out[y * 32 + x], one.values[1][one.At(100 + x, 60 + y)]);
}

// Across a straight seam, feathering ramps linearly over the blend width; multiband blending
// rises steadily within a few widths of the seam and keeps the values away from it.
TEST(Blend, FeatherRampsAndMultibandBlendsAroundAStraightSeam) {
    const int seam = 30;
    const Mosaic m = StraightSeam(seam);
    for (const int width : {2, 7, 16}) {
        SCOPED_TRACE(width);
        const std::vector<float> row = m.Blend(BlendMode::Feather, width, 64);
        // Pixel x lies (x - seam + 1/2) pixels right of the seam; 1/2 of each scene on it.
        for (int x = 0; x < m.width; ++x) {
            const double expected = 100.0 * std::clamp(0.5 + (x - seam + 0.5) / width, 0.0, 1.0);
            EXPECT_NEAR(row[x], expected, 1e-4) << x;
            if (x < 2 * seam) {
                EXPECT_NEAR(row[x] + row[2 * seam - 1 - x], 100.0, 1e-4) << x;  // symmetric
            }
        }
    }
    const int width = 8;
    const std::vector<float> row = m.Blend(BlendMode::Multiband, width, 64);
    int blended = 0;
    for (int x = 0; x < m.width; ++x) {
        if (x > 0) {
            EXPECT_GE(row[x], row[x - 1] - 1e-3f) << x;
        }
        if (x < 2 * seam) {
            EXPECT_NEAR(row[x] + row[2 * seam - 1 - x], 100.0, 1.0) << x;
        }
        if (row[x] > 1.0f && row[x] < 99.0f)
            ++blended;
    }
    EXPECT_GE(blended, width / 2);
    EXPECT_LE(blended, 3 * width);
    EXPECT_EQ(row[0], 0.0f);
    EXPECT_EQ(row[m.width - 1], 100.0f);
}

// Scene 1 does not see a strip left of the seam, scene 0 a strip right of it: there the other
// scene's value stands alone, in either mode; beside the strips both still blend.
TEST(Blend, AnUnseenSceneHasNoWeight) {
    const int seam = 30;
    Mosaic m = StraightSeam(seam);
    for (int y = 0; y < m.height; ++y) {
        for (int x = seam - 4; x < seam - 1; ++x)
            m.seen[1][m.At(x, y)] = 0;
        m.seen[0][m.At(seam + 2, y)] = 0;
    }
    for (const BlendMode mode : {BlendMode::Feather, BlendMode::Multiband}) {
        SCOPED_TRACE(mode == BlendMode::Feather ? "feather" : "multiband");
        const std::vector<float> blended = m.Blend(mode, 16, 64);
        for (int x = seam - 4; x < seam - 1; ++x)
            EXPECT_EQ(blended[x], 0.0f) << x;
        EXPECT_EQ(blended[seam + 2], 100.0f);
        EXPECT_GT(blended[seam - 1], 0.0f);
        EXPECT_LT(blended[seam + 1], 100.0f);
    }
}

float MaxDifference(const std::vector<float>& a, const std::vector<float>& b) {
    float worst = 0.0f;
    for (std::size_t p = 0; p < a.size(); ++p)
        worst = std::max(worst, std::abs(a[p] - b[p]));
    return worst;
}

// Tiles of 32 and 50 pixels (the scenes listed in another order) against one tile for the grid.
TEST(Blend, TilesAgreeWithTheWholeGrid) {
    const Mosaic m = Patchwork();
    const std::vector<float> whole = m.Blend(BlendMode::Feather, 16, 240);
    EXPECT_EQ(MaxDifference(m.Blend(BlendMode::Feather, 16, 32), whole), 0.0f);
    EXPECT_EQ(MaxDifference(m.Blend(BlendMode::Feather, 16, 50, true), whole), 0.0f);
    EXPECT_EQ(whole[0], kNoData);
    EXPECT_EQ(whole[m.width * m.height], kNoData);

    const std::vector<float> multiband = m.Blend(BlendMode::Multiband, 8, 240);
    EXPECT_LE(MaxDifference(m.Blend(BlendMode::Multiband, 8, 32), multiband), 1.0f);
    EXPECT_LE(MaxDifference(m.Blend(BlendMode::Multiband, 8, 50, true), multiband), 1.0f);
    EXPECT_EQ(multiband[0], kNoData);
}

TEST(Blend, RefusesTilesThatDoNotAddUp) {
    BlendTile tile = Patchwork().Tile(0, 0, 16, 16, 2);
    std::vector<float> out;
    EXPECT_THROW(BlendRegions(tile, BlendMode::Feather, -1, kNoData, out), kestrel::DataException);
    tile.seen[1].pop_back();
    EXPECT_THROW(BlendRegions(tile, BlendMode::Feather, 4, kNoData, out), kestrel::DataException);
}

}  // namespace
