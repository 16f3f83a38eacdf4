// Blending across seams.
//
// Feather: a scene's weight at a pixel falls linearly with the pixel's signed distance to the
// seam of the scene's region, from 1 at blendWidth / 2 inside to 0 at blendWidth / 2 outside,
// times 0 where the scene does not see the ground. Distances are exact Euclidean ones, so a
// pixel's result does not depend on the tiling. Only pixels within reach of another region are
// blended; the rest copy their region's value.
//
// Multiband: the scenes' Laplacian pyramids blended level by level with the Gaussian pyramids of
// their region masks (Burt and Adelson), as differences from the hard mosaic, so that pixels far
// from every seam keep their region's value exactly, as do pixels no other scene sees.
#include "blend.h"

#include <kestrel/exception.h>

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <limits>

namespace kestrel {
namespace processes {
namespace trueortho {

namespace {

// A squared distance out of reach.
constexpr std::int32_t kFar = std::numeric_limits<std::int32_t>::max();

void CheckTile(const BlendTile& tile, int blendWidth) {
    if (blendWidth < 0)
        KESTREL_THROW(DataException,
                      FormatString("Blending: blend width %d is negative", blendWidth));
    const int inner = std::min(tile.width, tile.height) - 2 * tile.border;
    if (tile.border < 0 || inner < 0 || tile.bands < 1)
        KESTREL_THROW(DataException,
                      FormatString("Blending: a tile of %d x %d pixels with a border of %d and %d "
                                   "bands is impossible",
                                   tile.width, tile.height, tile.border, tile.bands));
    const std::size_t full = static_cast<std::size_t>(tile.width) * tile.height;
    const std::size_t n = tile.scenes.size();
    if (tile.labels.size() != full || tile.values.size() != n || tile.seen.size() != n)
        KESTREL_THROW(
            DataException,
            FormatString("Blending: the tile's labels (%zu) or its scenes' values (%zu) "
                         "and visibility (%zu) do not match its %zu pixels and %zu scenes",
                         tile.labels.size(), tile.values.size(), tile.seen.size(), full, n));
    for (std::size_t k = 0; k < n; ++k)
        if (tile.values[k].size() != full * tile.bands || tile.seen[k].size() != full)
            KESTREL_THROW(DataException,
                          FormatString("Blending: scene %zu of the tile has %zu values and %zu "
                                       "visibility flags instead of %zu and %zu",
                                       tile.scenes[k], tile.values[k].size(), tile.seen[k].size(),
                                       full * tile.bands, full));
    for (const int label : tile.labels)
        if (label < -1 || label >= static_cast<int>(n))
            KESTREL_THROW(DataException,
                          FormatString("Blending: region label %d is not one of the tile's %zu "
                                       "scenes",
                                       label, n));
}

// The indices into tile.scenes of the scenes that have region pixels in the window, in the
// order of the job's scenes, so that sums run in the same order in every tile.
std::vector<int> ScenesWithRegions(const BlendTile& tile, int x0, int y0) {
    std::vector<char> present(tile.scenes.size(), 0);
    for (int y = y0; y < tile.height; ++y) {
        const int* row = tile.labels.data() + static_cast<std::size_t>(y) * tile.width;
        for (int x = x0; x < tile.width; ++x)
            if (row[x] >= 0)
                present[row[x]] = 1;
    }
    std::vector<int> order;
    for (std::size_t k = 0; k < present.size(); ++k)
        if (present[k])
            order.push_back(static_cast<int>(k));
    std::sort(order.begin(), order.end(),
              [&](int a, int b) { return tile.scenes[a] < tile.scenes[b]; });
    return order;
}

// One band of the window of w x h pixels at (x0, y0) of the tile, each pixel its region's value,
// `fill` where no region, into out (w x h).
void RegionValues(const BlendTile& tile, int x0, int y0, int w, int h, int band, float fill,
                  float* out) {
    const std::size_t full = static_cast<std::size_t>(tile.width) * tile.height;
    std::vector<const float*> scene(tile.scenes.size());
    for (std::size_t k = 0; k < scene.size(); ++k)
        scene[k] = tile.values[k].data() + full * band;
    for (int j = 0; j < h; ++j) {
        const std::size_t start = static_cast<std::size_t>(j + y0) * tile.width + x0;
        const int* label = tile.labels.data() + start;
        float* o = out + static_cast<std::size_t>(j) * w;
        for (int i = 0; i < w; ++i)
            o[i] = label[i] < 0 ? fill : scene[label[i]][start + i];
    }
}

// Every inner pixel its region's value; noData where no region.
void HardSeams(const BlendTile& tile, float noData, std::vector<float>& out) {
    const int b = tile.border, w = tile.width - 2 * b, h = tile.height - 2 * b;
    const std::size_t plane = static_cast<std::size_t>(w) * h;
    out.resize(plane * tile.bands);
    for (int band = 0; band < tile.bands; ++band)
        RegionValues(tile, b, b, w, h, band, noData, out.data() + plane * band);
}

// ---- Feather -------------------------------------------------------------------------------

// Squared distances from each pixel of a window of the tile to the nearest pixel of the window
// labelled `label`: exact where the distance is below `reach`, kFar where it is not. Column
// distances first, then the lower envelope of parabolas along each row (Felzenszwalb and
// Huttenlocher).
class RegionDistance {
  public:
    void Compute(const BlendTile& tile, int x0, int y0, int w, int h, int label, int reach,
                 std::vector<std::int32_t>& d2) {
        column_.resize(static_cast<std::size_t>(w) * h);
        for (int y = 0; y < h; ++y) {
            const int* lab =
                tile.labels.data() + static_cast<std::size_t>(y0 + y) * tile.width + x0;
            int* g = column_.data() + static_cast<std::size_t>(y) * w;
            if (y == 0)
                for (int x = 0; x < w; ++x)
                    g[x] = lab[x] == label ? 0 : reach;
            else
                for (int x = 0; x < w; ++x)
                    g[x] = lab[x] == label ? 0 : std::min(g[x - w] + 1, reach);
        }
        for (int y = h - 2; y >= 0; --y) {
            int* g = column_.data() + static_cast<std::size_t>(y) * w;
            const int* below = g + w;
            for (int x = 0; x < w; ++x)
                g[x] = std::min(g[x], below[x] + 1);
        }
        d2.resize(static_cast<std::size_t>(w) * h);
        const std::int32_t cap = reach * reach;
        for (int y = 0; y < h; ++y)
            Row(column_.data() + static_cast<std::size_t>(y) * w, w, reach, cap,
                d2.data() + static_cast<std::size_t>(y) * w);
    }

  private:
    // One row: g holds column distances (reach: out of reach). Inside a run of zeros only the
    // run's ends can be nearest to a pixel outside it, so only they enter the envelope.
    void Row(const int* g, int w, int reach, std::int32_t cap, std::int32_t* d2) {
        sites_.clear();
        for (int x = 0; x < w; ++x)
            if (g[x] < reach &&
                !(g[x] == 0 && x > 0 && x + 1 < w && g[x - 1] == 0 && g[x + 1] == 0))
                sites_.push_back(x);
        if (sites_.empty()) {
            std::fill(d2, d2 + w, kFar);
            return;
        }
        const auto f = [&](int q) { return static_cast<double>(g[q]) * g[q]; };
        envelope_.assign(sites_.size(), 0);
        bounds_.assign(sites_.size() + 1, 0.0);
        std::size_t k = 0;
        envelope_[0] = sites_[0];
        bounds_[0] = -std::numeric_limits<double>::infinity();
        bounds_[1] = std::numeric_limits<double>::infinity();
        for (std::size_t i = 1; i < sites_.size(); ++i) {
            const int q = sites_[i];
            const auto meet = [&](int v) {
                return ((f(q) + static_cast<double>(q) * q) - (f(v) + static_cast<double>(v) * v)) /
                       (2.0 * (q - v));
            };
            double s = meet(envelope_[k]);
            while (s <= bounds_[k])  // bounds_[0] is -infinity
                s = meet(envelope_[--k]);
            ++k;
            envelope_[k] = q;
            bounds_[k] = s;
            bounds_[k + 1] = std::numeric_limits<double>::infinity();
        }
        k = 0;
        for (int x = 0; x < w; ++x) {
            while (bounds_[k + 1] < x)
                ++k;
            const int v = envelope_[k];
            const std::int32_t d = (x - v) * (x - v) + g[v] * g[v];
            d2[x] = g[x] == 0 ? 0 : d < cap ? d : kFar;
        }
    }

    std::vector<int> column_, sites_, envelope_;
    std::vector<double> bounds_;
};

// Feather works on blocks of the inner tile, each with the pixels within reach around it.
constexpr int kBlock = 64;

// One bit per scene; scenes from the 64th on share the last two, so that a block they meet is
// always worked on.
std::uint64_t SceneBit(int k) {
    return k < 63 ? std::uint64_t{1} << k : std::uint64_t{3} << 62;
}

// The scenes whose regions meet each block of kBlock x kBlock pixels of the whole tile.
std::vector<std::uint64_t> BlockScenes(const BlendTile& tile, int blocksX, int blocksY) {
    std::vector<std::uint64_t> bits(static_cast<std::size_t>(blocksX) * blocksY, 0);
    for (int y = 0; y < tile.height; ++y) {
        const int* label = tile.labels.data() + static_cast<std::size_t>(y) * tile.width;
        std::uint64_t* row = bits.data() + static_cast<std::size_t>(y / kBlock) * blocksX;
        for (int bx = 0; bx < blocksX; ++bx) {
            int previous = -1;
            for (int x = bx * kBlock; x < std::min((bx + 1) * kBlock, tile.width); ++x)
                if (label[x] != previous) {
                    previous = label[x];
                    if (previous >= 0)
                        row[bx] |= SceneBit(previous);
                }
        }
    }
    return bits;
}

// Reused from tile to tile by each thread.
struct FeatherBuffers {
    RegionDistance distance;
    std::vector<std::vector<std::int32_t>> d2;
    std::vector<float> weight;
};

struct Rect {
    int x0, y0, x1, y1;
};

void Feather(const BlendTile& tile, const std::vector<int>& order, int blendWidth, float noData,
             std::vector<float>& out) {
    // Hard seams first: only pixels within reach of another region change.
    HardSeams(tile, noData, out);
    // A scene takes part at a pixel up to blendWidth / 2 + 1/2 pixels outside its region (the
    // seam lies half a pixel from the centres of the pixels beside it): 4 d^2 < (W + 1)^2.
    const int reach = blendWidth / 2 + 1;
    const std::int64_t limit = static_cast<std::int64_t>(blendWidth + 1) * (blendWidth + 1);
    const auto inReach = [limit](std::int32_t squared) {
        return 4 * static_cast<std::int64_t>(squared) < limit;
    };
    const float width = static_cast<float>(blendWidth);
    // The weight of a scene d pixels (centre to centre) from its region, and of the region's own
    // scene d pixels from the nearest other region.
    const auto outside = [&](std::int32_t squared) {
        return (width + 1.0f - 2.0f * std::sqrt(static_cast<float>(squared))) / (2.0f * width);
    };
    const auto inside = [&](std::int32_t squared) {
        return std::min(
            1.0f, (width - 1.0f + 2.0f * std::sqrt(static_cast<float>(squared))) / (2.0f * width));
    };

    const int blocksX = (tile.width + kBlock - 1) / kBlock,
              blocksY = (tile.height + kBlock - 1) / kBlock;
    const std::vector<std::uint64_t> blockScenes = BlockScenes(tile, blocksX, blocksY);
    thread_local FeatherBuffers buffers;
    std::vector<std::vector<std::int32_t>>& d2 = buffers.d2;
    d2.resize(std::max(d2.size(), tile.scenes.size()));
    std::vector<float>& weight = buffers.weight;
    weight.resize(tile.scenes.size());

    const int b = tile.border, w = tile.width - 2 * b, h = tile.height - 2 * b;
    const std::size_t plane = static_cast<std::size_t>(w) * h;
    const std::size_t full = static_cast<std::size_t>(tile.width) * tile.height;
    for (int by = 0; by < h; by += kBlock)
        for (int bx = 0; bx < w; bx += kBlock) {
            // The block in tile coordinates, and the window of the pixels within reach of it.
            const Rect block{b + bx, b + by, b + std::min(bx + kBlock, w),
                             b + std::min(by + kBlock, h)};
            const Rect near{std::max(block.x0 - reach, 0), std::max(block.y0 - reach, 0),
                            std::min(block.x1 + reach, tile.width),
                            std::min(block.y1 + reach, tile.height)};
            std::uint64_t present = 0;
            for (int y = near.y0 / kBlock; y <= (near.y1 - 1) / kBlock; ++y)
                for (int x = near.x0 / kBlock; x <= (near.x1 - 1) / kBlock; ++x)
                    present |= blockScenes[static_cast<std::size_t>(y) * blocksX + x];
            if ((present & (present - 1)) == 0)  // one region at most: hard seams are right
                continue;
            const int nw = near.x1 - near.x0, nh = near.y1 - near.y0;
            for (const int k : order)
                if (present & SceneBit(k))
                    buffers.distance.Compute(tile, near.x0, near.y0, nw, nh, k, reach, d2[k]);
                else
                    d2[k].assign(static_cast<std::size_t>(nw) * nh, kFar);
            for (int y = block.y0; y < block.y1; ++y)
                for (int x = block.x0; x < block.x1; ++x) {
                    const std::size_t p = static_cast<std::size_t>(y) * tile.width + x;
                    const std::size_t q = static_cast<std::size_t>(y - near.y0) * nw + x - near.x0;
                    const int label = tile.labels[p];
                    if (label < 0)
                        continue;
                    std::int32_t nearest = kFar;
                    for (const int k : order)
                        if (k != label && d2[k][q] < nearest)
                            nearest = d2[k][q];
                    if (!inReach(nearest))
                        continue;
                    int contributors = 0, last = label;
                    float sum = 0.0f;
                    for (const int k : order) {
                        float wk = 0.0f;
                        if (tile.seen[k][p])
                            wk = k == label          ? inside(nearest)
                                 : inReach(d2[k][q]) ? outside(d2[k][q])
                                                     : 0.0f;
                        weight[k] = wk;
                        if (wk > 0.0f)
                            ++contributors, last = k, sum += wk;
                    }
                    const std::size_t o = static_cast<std::size_t>(y - b) * w + x - b;
                    for (int band = 0; band < tile.bands; ++band) {
                        float v = tile.values[last][full * band + p];
                        if (contributors > 1) {
                            v = 0.0f;
                            for (const int k : order)
                                if (weight[k] > 0.0f)
                                    v += weight[k] * tile.values[k][full * band + p];
                            v /= sum;
                        }
                        out[plane * band + o] = v;
                    }
                }
        }
}

// ---- Multiband -----------------------------------------------------------------------------

// Pyramid levels below full resolution: log2 of the blend width, less one (at least one), so
// that a step between two scenes changes from 10 % to 90 % over about the width (1 % to 99 %
// over about twice it).
int Levels(int blendWidth) {
    if (blendWidth < 2)
        return 0;
    int levels = 1;
    while ((4 << levels) <= blendWidth && levels < 10)
        ++levels;
    return levels;
}

// The border of a multiband tile in cells of the coarsest level, besides one cell that aligning
// the pyramid to the grid may cost: what a pixel's result depends on beyond it is below float
// rounding in the tests (2 cells leave differences of a few hundredths of a grey level).
constexpr int kMultibandBorderCells = 3;

struct Plane {
    int w = 0, h = 0;
    std::vector<float> v;
    Plane() = default;
    Plane(int width, int height, float value = 0.0f)
        : w(width), h(height), v(static_cast<std::size_t>(width) * height, value) {}
    float& at(int x, int y) { return v[static_cast<std::size_t>(y) * w + x]; }
    float at(int x, int y) const { return v[static_cast<std::size_t>(y) * w + x]; }
};

// The next level of a Gaussian pyramid: the 5-tap binomial kernel, every second pixel, edges
// repeated.
Plane Reduce(const Plane& src) {
    const int w = (src.w + 1) / 2, h = (src.h + 1) / 2;
    Plane rows(w, src.h), dst(w, h);
    const auto cx = [&](int x) { return std::min(std::max(x, 0), src.w - 1); };
    const auto cy = [&](int y) { return std::min(std::max(y, 0), src.h - 1); };
    // Columns whose taps all lie inside: 2 <= 2i and 2i + 2 < src.w.
    const int first = std::min(1, w), last = std::max(first, std::min(w, (src.w - 1) / 2));
    for (int y = 0; y < src.h; ++y) {
        const float* in = &src.v[static_cast<std::size_t>(y) * src.w];
        float* r = &rows.v[static_cast<std::size_t>(y) * w];
        const auto tap = [&](int i) {
            const int x = 2 * i;
            r[i] = (in[cx(x - 2)] + in[cx(x + 2)] + 4.0f * (in[cx(x - 1)] + in[cx(x + 1)]) +
                    6.0f * in[x]) *
                   (1.0f / 16.0f);
        };
        for (int i = 0; i < first; ++i)
            tap(i);
        for (int i = first; i < last; ++i) {
            const float* c = in + 2 * i;
            r[i] = (c[-2] + c[2] + 4.0f * (c[-1] + c[1]) + 6.0f * c[0]) * (1.0f / 16.0f);
        }
        for (int i = last; i < w; ++i)
            tap(i);
    }
    for (int j = 0; j < h; ++j) {
        const int y = 2 * j;
        const float* r0 = &rows.v[static_cast<std::size_t>(cy(y - 2)) * w];
        const float* r1 = &rows.v[static_cast<std::size_t>(cy(y - 1)) * w];
        const float* r2 = &rows.v[static_cast<std::size_t>(y) * w];
        const float* r3 = &rows.v[static_cast<std::size_t>(cy(y + 1)) * w];
        const float* r4 = &rows.v[static_cast<std::size_t>(cy(y + 2)) * w];
        float* d = &dst.v[static_cast<std::size_t>(j) * w];
        for (int i = 0; i < w; ++i)
            d[i] = (r0[i] + r4[i] + 4.0f * (r1[i] + r3[i]) + 6.0f * r2[i]) * (1.0f / 16.0f);
    }
    return dst;
}

// A level brought up to the size of the level above: the same kernel on the doubled lattice.
Plane Expand(const Plane& src, int w, int h) {
    Plane cols(w, src.h), dst(w, h);
    const auto cx = [&](int i) { return std::min(std::max(i, 0), src.w - 1); };
    // Columns whose taps all lie inside: 1 <= x / 2 and x / 2 + 1 < src.w.
    const int first = std::min(2, w), last = std::max(first, std::min(w, 2 * (src.w - 1)));
    for (int y = 0; y < src.h; ++y) {
        const float* in = &src.v[static_cast<std::size_t>(y) * src.w];
        float* c = &cols.v[static_cast<std::size_t>(y) * w];
        const auto tap = [&](int x) {
            const int i = x / 2;
            c[x] = x % 2 == 0 ? (in[cx(i - 1)] + 6.0f * in[cx(i)] + in[cx(i + 1)]) * 0.125f
                              : (in[cx(i)] + in[cx(i + 1)]) * 0.5f;
        };
        for (int x = 0; x < first; ++x)
            tap(x);
        int x = first;
        for (; x + 1 < last; x += 2) {
            const float* m = in + x / 2;
            c[x] = (m[-1] + 6.0f * m[0] + m[1]) * 0.125f;
            c[x + 1] = (m[0] + m[1]) * 0.5f;
        }
        for (; x < w; ++x)
            tap(x);
    }
    for (int y = 0; y < h; ++y) {
        const int j = y / 2;
        const auto row = [&](int r) {
            return &cols.v[static_cast<std::size_t>(std::min(std::max(r, 0), src.h - 1)) * w];
        };
        float* d = &dst.v[static_cast<std::size_t>(y) * w];
        if (y % 2 == 0) {
            const float *a = row(j - 1), *m = row(j), *c = row(j + 1);
            for (int x = 0; x < w; ++x)
                d[x] = (a[x] + 6.0f * m[x] + c[x]) * 0.125f;
        } else {
            const float *m = row(j), *c = row(j + 1);
            for (int x = 0; x < w; ++x)
                d[x] = (m[x] + c[x]) * 0.5f;
        }
    }
    return dst;
}

std::vector<Plane> Gaussian(Plane base, int levels) {
    std::vector<Plane> pyramid;
    pyramid.push_back(std::move(base));
    for (int k = 0; k < levels; ++k)
        pyramid.push_back(Reduce(pyramid.back()));
    return pyramid;
}

void Multiband(const BlendTile& tile, int blendWidth, float noData, std::vector<float>& out) {
    const int levels = Levels(blendWidth), cell = 1 << levels;
    // The window of the tile whose origin lies on a multiple of `cell` on the mosaic grid, so
    // that every tile builds the same pyramid.
    const auto skip = [&](int origin) { return ((tile.border - origin) % cell + cell) % cell; };
    const int sx = skip(tile.x0), sy = skip(tile.y0);
    const int w = tile.width - sx, h = tile.height - sy;
    const std::vector<int> order = ScenesWithRegions(tile, sx, sy);
    if (order.size() < 2) {
        HardSeams(tile, noData, out);
        return;
    }
    const std::size_t full = static_cast<std::size_t>(tile.width) * tile.height;
    const auto at = [&](int x, int y) {
        return static_cast<std::size_t>(y + sy) * tile.width + x + sx;
    };

    // The hard mosaic, and the sum of the scenes' weights per level.
    std::vector<Plane> hard(tile.bands, Plane(w, h));
    for (int band = 0; band < tile.bands; ++band)
        RegionValues(tile, sx, sy, w, h, band, 0.0f, hard[band].v.data());
    std::vector<Plane> total;
    std::vector<std::vector<Plane>> blended(tile.bands);
    for (const int k : order) {
        Plane mask(w, h);
        for (int y = 0; y < h; ++y) {
            const int* label = &tile.labels[at(0, y)];
            const unsigned char* seen = &tile.seen[k][at(0, y)];
            float* m = &mask.at(0, y);
            for (int x = 0; x < w; ++x)
                m[x] = label[x] == k && seen[x] ? 1.0f : 0.0f;
        }
        const std::vector<Plane> weights = Gaussian(std::move(mask), levels);
        if (total.empty())
            total = weights;
        else
            for (int l = 0; l <= levels; ++l)
                for (std::size_t i = 0; i < total[l].v.size(); ++i)
                    total[l].v[i] += weights[l].v[i];
        for (int band = 0; band < tile.bands; ++band) {
            // The scene's difference from the hard mosaic, 0 where it does not see the ground.
            Plane difference(w, h);
            for (int y = 0; y < h; ++y) {
                const int* label = &tile.labels[at(0, y)];
                const unsigned char* seen = &tile.seen[k][at(0, y)];
                const float* value = &tile.values[k][full * band + at(0, y)];
                const float* region = &hard[band].at(0, y);
                float* d = &difference.at(0, y);
                for (int x = 0; x < w; ++x)
                    d[x] = seen[x] && label[x] >= 0 ? value[x] - region[x] : 0.0f;
            }
            std::vector<Plane> laplacian = Gaussian(std::move(difference), levels);
            for (int l = 0; l < levels; ++l) {
                const Plane up = Expand(laplacian[l + 1], laplacian[l].w, laplacian[l].h);
                for (std::size_t i = 0; i < up.v.size(); ++i)
                    laplacian[l].v[i] -= up.v[i];
            }
            std::vector<Plane>& sum = blended[band];
            if (sum.empty())
                for (const Plane& level : laplacian)
                    sum.emplace_back(level.w, level.h);
            for (int l = 0; l <= levels; ++l)
                for (std::size_t i = 0; i < sum[l].v.size(); ++i)
                    sum[l].v[i] += weights[l].v[i] * laplacian[l].v[i];
        }
    }

    // Where no scene weighs anything, no level adds anything.
    for (Plane& level : total)
        for (float& t : level.v)
            t = t > 1e-6f ? 1.0f / t : 0.0f;
    const int b = tile.border, iw = tile.width - 2 * b, ih = tile.height - 2 * b;
    const std::size_t plane = static_cast<std::size_t>(iw) * ih;
    // Inner pixels that no scene but their region's sees keep its value: the other scenes'
    // coarse levels reach into the ground they do not see.
    std::vector<unsigned char> alone(plane, 1);
    for (int j = 0; j < ih; ++j)
        for (int i = 0; i < iw; ++i) {
            const std::size_t p = static_cast<std::size_t>(j + b) * tile.width + i + b;
            for (const int k : order)
                if (k != tile.labels[p] && tile.seen[k][p]) {
                    alone[static_cast<std::size_t>(j) * iw + i] = 0;
                    break;
                }
        }
    out.resize(plane * tile.bands);
    for (int band = 0; band < tile.bands; ++band) {
        std::vector<Plane>& sum = blended[band];
        for (int l = 0; l <= levels; ++l)
            for (std::size_t i = 0; i < sum[l].v.size(); ++i)
                sum[l].v[i] *= total[l].v[i];
        Plane collapsed = std::move(sum[levels]);
        for (int l = levels - 1; l >= 0; --l) {
            Plane up = Expand(collapsed, sum[l].w, sum[l].h);
            for (std::size_t i = 0; i < up.v.size(); ++i)
                up.v[i] += sum[l].v[i];
            collapsed = std::move(up);
        }
        for (int j = 0; j < ih; ++j) {
            const int y = j + b - sy;
            const int* label = &tile.labels[at(b - sx, y)];
            const float* region = &hard[band].at(b - sx, y);
            const float* change = &collapsed.at(b - sx, y);
            const unsigned char* only = alone.data() + static_cast<std::size_t>(j) * iw;
            float* o = out.data() + plane * band + static_cast<std::size_t>(j) * iw;
            for (int i = 0; i < iw; ++i)
                o[i] = label[i] < 0 ? noData : only[i] ? region[i] : region[i] + change[i];
        }
    }
}

}  // namespace

int BlendBorder(BlendMode mode, int blendWidth) {
    if (blendWidth <= 0)
        return 0;
    if (mode == BlendMode::Feather)
        return blendWidth / 2 + 1;
    const int levels = Levels(blendWidth);
    return levels == 0 ? 0 : (kMultibandBorderCells + 1) << levels;
}

bool HardSeamsOnly(BlendMode mode, int blendWidth, std::size_t scenes) {
    if (blendWidth == 0 || (mode == BlendMode::Multiband && Levels(blendWidth) == 0))
        return true;
    return mode == BlendMode::Feather && scenes < 2;
}

void BlendRegions(const BlendTile& tile, BlendMode mode, int blendWidth, float noData,
                  std::vector<float>& out) {
    CheckTile(tile, blendWidth);
    if (HardSeamsOnly(mode, blendWidth, tile.scenes.size())) {
        HardSeams(tile, noData, out);
        return;
    }
    if (mode == BlendMode::Multiband) {
        Multiband(tile, blendWidth, noData, out);
        return;
    }
    const std::vector<int> order = ScenesWithRegions(tile, 0, 0);
    if (HardSeamsOnly(mode, blendWidth, order.size()))
        HardSeams(tile, noData, out);
    else
        Feather(tile, order, blendWidth, noData, out);
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
