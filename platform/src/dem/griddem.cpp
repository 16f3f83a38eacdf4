#include "griddem.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <limits>
#include <utility>

namespace kestrel {
namespace dem {
namespace detail {

PostSource::~PostSource() = default;

GridDEM::GridDEM(std::unique_ptr<PostSource> posts, const ogc::cs::GeocodingInfo& geocoding,
                 std::unique_ptr<ogc::cs::ICRS> crs, ogc::cs::DatumType datum, std::string name)
    : GridDEM(std::move(posts), geocoding, std::move(crs), datum, std::move(name),
              PixelArea{0.0, 0.0, 0.0, 0.0}) {
    area_ = PixelArea{0.0, 0.0, static_cast<double>(posts_->width),
                      static_cast<double>(posts_->height)};
}

GridDEM::GridDEM(std::unique_ptr<PostSource> posts, const ogc::cs::GeocodingInfo& geocoding,
                 std::unique_ptr<ogc::cs::ICRS> crs, ogc::cs::DatumType datum, std::string name,
                 const PixelArea& area)
    : posts_(std::move(posts)),
      geocoding_(geocoding),
      frame_(std::move(crs), datum, std::move(name)),
      area_(area) {}

GridDEM::~GridDEM() = default;

void GridDEM::GetExtent(double& minX, double& minY, double& maxX, double& maxY) const {
    minX = minY = std::numeric_limits<double>::infinity();
    maxX = maxY = -minX;
    for (double p : {area_.left, area_.right}) {
        for (double l : {area_.top, area_.bottom}) {
            double x, y;
            geocoding_.PixelToGround(p, l, x, y);
            minX = std::min(minX, x), maxX = std::max(maxX, x);
            minY = std::min(minY, y), maxY = std::max(maxY, y);
        }
    }
}

void GridDEM::GetHeights(std::size_t n, const double* x, const double* y, double* heights) const {
    frame_.Query(
        n, x, y, heights,
        [this](std::size_t m, const double* gx, const double* gy, double* h) {
            Sample(m, gx, gy, h);
        },
        !postsConverted_);
}

void GridDEM::ForgetSummaries() {
    std::lock_guard<std::mutex> lock(summaryMutex_);
    summaries_.clear();
}

const GridDEM::BlockSummary& GridDEM::Summary(unsigned int blockX, unsigned int blockY) const {
    const PostSource& posts = *posts_;
    const unsigned int blocksX = (posts.width + posts.blockWidth - 1) / posts.blockWidth;
    const unsigned int blocksY = (posts.height + posts.blockHeight - 1) / posts.blockHeight;
    const std::size_t key = static_cast<std::size_t>(blockY) * blocksX + blockX;
    {
        std::lock_guard<std::mutex> lock(summaryMutex_);
        if (summaries_.empty())
            summaries_.resize(static_cast<std::size_t>(blocksX) * blocksY);
        if (summaries_[key])
            return *summaries_[key];
    }
    const std::shared_ptr<const PostBlock> block = posts.GetBlock(blockX, blockY);
    auto summary = std::make_unique<BlockSummary>();
    summary->columns = (block->width + kCell - 1) / kCell;
    const unsigned int rows = (block->height + kCell - 1) / kCell;
    summary->low.assign(static_cast<std::size_t>(summary->columns) * rows, NAN);
    summary->high = summary->low;
    for (unsigned int j = 0; j < block->height; ++j) {
        for (unsigned int i = 0; i < block->width; ++i) {
            const float v = block->heights[static_cast<std::size_t>(j) * block->width + i];
            if (std::isnan(v))
                continue;
            const std::size_t c =
                static_cast<std::size_t>(j / kCell) * summary->columns + i / kCell;
            // NaN compares false: the first height of a cell replaces it.
            if (!(summary->low[c] <= v))
                summary->low[c] = v;
            if (!(summary->high[c] >= v))
                summary->high[c] = v;
        }
    }
    std::lock_guard<std::mutex> lock(summaryMutex_);
    if (!summaries_[key])
        summaries_[key] = std::move(summary);
    return *summaries_[key];
}

bool GridDEM::PixelWindow(double minX, double minY, double maxX, double maxY,
                          PixelArea& window) const {
    if (!frame_.OwnRectangle(minX, minY, maxX, maxY))
        return false;
    double left = INFINITY, top = INFINITY, right = -INFINITY, bottom = -INFINITY;
    for (double x : {minX, maxX}) {
        for (double y : {minY, maxY}) {
            double pixel, line;
            geocoding_.GroundToPixel(x, y, pixel, line);
            left = std::min(left, pixel), right = std::max(right, pixel);
            top = std::min(top, line), bottom = std::max(bottom, line);
        }
    }
    window.left = std::max(left, area_.left), window.right = std::min(right, area_.right);
    window.top = std::max(top, area_.top), window.bottom = std::min(bottom, area_.bottom);
    return window.left <= window.right && window.top <= window.bottom;
}

namespace {

unsigned int ClampPost(double v, unsigned int size) {
    return static_cast<unsigned int>(std::clamp(v, 0.0, static_cast<double>(size) - 1.0));
}

}  // namespace

bool GridDEM::CountPosts(double minX, double minY, double maxX, double maxY, std::size_t& posts,
                         std::size_t& holes) const {
    PixelArea window;
    if (!PixelWindow(minX, minY, maxX, maxY, window))
        return false;
    // Posts whose centres (i + 0.5, j + 0.5) lie in the window.
    const PostSource& source = *posts_;
    const double i0 = std::ceil(window.left - 0.5), i1 = std::floor(window.right - 0.5);
    const double j0 = std::ceil(window.top - 0.5), j1 = std::floor(window.bottom - 0.5);
    posts = holes = 0;
    if (!(i0 <= i1 && j0 <= j1) || i1 < 0 || j1 < 0 || i0 >= source.width || j0 >= source.height)
        return true;
    const unsigned int a0 = ClampPost(i0, source.width), a1 = ClampPost(i1, source.width);
    const unsigned int b0 = ClampPost(j0, source.height), b1 = ClampPost(j1, source.height);
    const unsigned int bw = source.blockWidth, bh = source.blockHeight;
    for (unsigned int by = b0 / bh; by <= b1 / bh; ++by) {
        for (unsigned int bx = a0 / bw; bx <= a1 / bw; ++bx) {
            const std::shared_ptr<const PostBlock> block = source.GetBlock(bx, by);
            for (unsigned int j = std::max(b0, by * bh); j <= std::min(b1, by * bh + bh - 1); ++j) {
                for (unsigned int i = std::max(a0, bx * bw); i <= std::min(a1, bx * bw + bw - 1);
                     ++i) {
                    ++posts;
                    holes += std::isnan(
                        block->heights[static_cast<std::size_t>(j - by * bh) * block->width +
                                       (i - bx * bw)]);
                }
            }
        }
    }
    return true;
}

bool GridDEM::GetHeightRange(double minX, double minY, double maxX, double maxY, double& lowest,
                             double& highest) const {
    PixelArea window;
    if (!PixelWindow(minX, minY, maxX, maxY, window))
        return false;
    // The posts that a bilinear height in the window weighs: those around each point.
    const PostSource& posts = *posts_;
    const unsigned int i0 = ClampPost(std::floor(window.left - 0.5), posts.width);
    const unsigned int i1 = ClampPost(std::floor(window.right - 0.5) + 1.0, posts.width);
    const unsigned int j0 = ClampPost(std::floor(window.top - 0.5), posts.height);
    const unsigned int j1 = ClampPost(std::floor(window.bottom - 0.5) + 1.0, posts.height);
    const unsigned int bw = posts.blockWidth, bh = posts.blockHeight;
    double low = INFINITY, high = -INFINITY;
    for (unsigned int by = j0 / bh; by <= j1 / bh; ++by) {
        for (unsigned int bx = i0 / bw; bx <= i1 / bw; ++bx) {
            const BlockSummary& summary = Summary(bx, by);
            const unsigned int ci0 = (std::max(i0, bx * bw) - bx * bw) / kCell;
            const unsigned int ci1 = (std::min(i1, bx * bw + bw - 1) - bx * bw) / kCell;
            const unsigned int cj0 = (std::max(j0, by * bh) - by * bh) / kCell;
            const unsigned int cj1 = (std::min(j1, by * bh + bh - 1) - by * bh) / kCell;
            for (unsigned int cj = cj0; cj <= cj1; ++cj) {
                for (unsigned int ci = ci0; ci <= ci1; ++ci) {
                    const std::size_t c = static_cast<std::size_t>(cj) * summary.columns + ci;
                    if (std::isnan(summary.low[c]))
                        continue;
                    low = std::min(low, static_cast<double>(summary.low[c]));
                    high = std::max(high, static_cast<double>(summary.high[c]));
                }
            }
        }
    }
    if (!(low <= high))
        return false;
    if (!postsConverted_) {
        // The change of datum over the window's own rectangle.
        double x0, y0, x1, y1;
        geocoding_.PixelToGround(window.left, window.top, x0, y0);
        geocoding_.PixelToGround(window.right, window.bottom, x1, y1);
        frame_.WidenToOutput(std::min(x0, x1), std::min(y0, y1), std::max(x0, x1), std::max(y0, y1),
                             low, high);
    }
    if (!(low <= high))
        return false;
    lowest = low;
    highest = high;
    return true;
}

namespace {

constexpr std::uint32_t kOutside = std::numeric_limits<std::uint32_t>::max();

// The blocks a run of lookups needs, fetched once each while the run lasts.
class BlockMemo {
  public:
    explicit BlockMemo(const PostSource& posts)
        : posts_(posts), blocksX_((posts.width + posts.blockWidth - 1) / posts.blockWidth) {}

    const PostBlock& Get(std::uint32_t key) {
        for (auto& slot : slots_) {
            if (slot.block && slot.key == key)
                return *slot.block;
        }
        Slot& slot = slots_[next_];
        next_ = (next_ + 1) % slots_.size();
        slot.key = key;
        slot.block = posts_.GetBlock(key % blocksX_, key / blocksX_);
        return *slot.block;
    }

    // The height of post (i, j); NaN outside the grid.
    float Post(long long i, long long j) {
        if (i < 0 || j < 0 || i >= posts_.width || j >= posts_.height)
            return NAN;
        const auto bx = static_cast<std::uint32_t>(i / posts_.blockWidth);
        const auto by = static_cast<std::uint32_t>(j / posts_.blockHeight);
        const PostBlock& b = Get(by * blocksX_ + bx);
        const auto ci =
            static_cast<std::size_t>(i - static_cast<long long>(bx) * posts_.blockWidth);
        const auto cj =
            static_cast<std::size_t>(j - static_cast<long long>(by) * posts_.blockHeight);
        return b.heights[cj * b.width + ci];
    }

    std::uint32_t BlocksX() const { return blocksX_; }

  private:
    struct Slot {
        std::uint32_t key = 0;
        std::shared_ptr<const PostBlock> block;
    };
    const PostSource& posts_;
    std::uint32_t blocksX_;
    std::array<Slot, 4> slots_;
    std::size_t next_ = 0;
};

// Bilinear weighting of the posts around a point; posts without a height are left out and the
// weights of the others renormalised.
double Blend(float v00, float v10, float v01, float v11, double tx, double ty) {
    double sum = 0.0, weight = 0.0;
    const auto add = [&](float v, double w) {
        if (!std::isnan(v)) {
            sum += w * v;
            weight += w;
        }
    };
    add(v00, (1.0 - tx) * (1.0 - ty));
    add(v10, tx * (1.0 - ty));
    add(v01, (1.0 - tx) * ty);
    add(v11, tx * ty);
    return weight > 0.0 ? sum / weight : NAN;
}

}  // namespace

void GridDEM::Sample(std::size_t n, const double* x, const double* y, double* heights) const {
    const PostSource& posts = *posts_;
    BlockMemo memo(posts);
    const long long width = posts.width, height = posts.height;
    const unsigned int bw = posts.blockWidth, bh = posts.blockHeight;

    // Post coordinates of a ground point: post (i, j) stands at pixel (i + 0.5, j + 0.5).
    const auto toPost = [&](std::size_t i, double& fx, double& fy) {
        double pixel, line;
        geocoding_.GroundToPixel(x[i], y[i], pixel, line);
        if (!(pixel >= area_.left && pixel <= area_.right && line >= area_.top &&
              line <= area_.bottom))
            return false;
        fx = pixel - 0.5;
        fy = line - 0.5;
        return true;
    };

    // The height at post coordinates (fx, fy) of a point whose upper-left post is in block key.
    const auto evaluate = [&](double fx, double fy, std::uint32_t key) {
        const double fi = std::floor(fx), fj = std::floor(fy);
        const double tx = fx - fi, ty = fy - fj;
        const auto i0 = static_cast<long long>(fi), j0 = static_cast<long long>(fj);
        const PostBlock& b = memo.Get(key);
        const long long ox = static_cast<long long>(key % memo.BlocksX()) * bw;
        const long long oy = static_cast<long long>(key / memo.BlocksX()) * bh;
        if (i0 >= ox && j0 >= oy && i0 + 1 < ox + b.width && j0 + 1 < oy + b.height) {
            const float* p = &b.heights[static_cast<std::size_t>(j0 - oy) * b.width +
                                        static_cast<std::size_t>(i0 - ox)];
            return Blend(p[0], p[1], p[b.width], p[b.width + 1], tx, ty);
        }
        return Blend(memo.Post(i0, j0), memo.Post(i0 + 1, j0), memo.Post(i0, j0 + 1),
                     memo.Post(i0 + 1, j0 + 1), tx, ty);
    };

    // Each point is keyed by the block of its upper-left post (clamped into the grid).
    const auto keyOf = [&](double fx, double fy) {
        const long long i0 = std::clamp(static_cast<long long>(std::floor(fx)), 0LL, width - 1);
        const long long j0 = std::clamp(static_cast<long long>(std::floor(fy)), 0LL, height - 1);
        return static_cast<std::uint32_t>(j0 / bh) * memo.BlocksX() +
               static_cast<std::uint32_t>(i0 / bw);
    };

    const std::uint32_t blockCount =
        memo.BlocksX() * static_cast<std::uint32_t>((posts.height + bh - 1) / bh);
    constexpr std::size_t kSortFrom = 64;
    if (n < kSortFrom || blockCount == 1) {
        for (std::size_t i = 0; i < n; ++i) {
            double fx, fy;
            heights[i] = toPost(i, fx, fy) ? evaluate(fx, fy, keyOf(fx, fy)) : NAN;
        }
        return;
    }

    // A batch is answered block by block (a counting sort of the points by block), so that each
    // block is fetched once however the points are scattered. The sorted points are evaluated in
    // order and their heights scattered back.
    constexpr std::size_t kChunk = std::size_t(1) << 30;
    for (std::size_t start = 0; start < n; start += kChunk) {
        const std::size_t count = std::min(kChunk, n - start);
        std::vector<std::uint32_t> keys(count);
        std::vector<std::uint32_t> offsets(static_cast<std::size_t>(blockCount) + 1, 0);
        for (std::size_t k = 0; k < count; ++k) {
            double fx, fy;
            if (toPost(start + k, fx, fy)) {
                keys[k] = keyOf(fx, fy);
                ++offsets[keys[k] + 1];
            } else {
                keys[k] = kOutside;
                heights[start + k] = NAN;
            }
        }
        for (std::size_t b = 1; b < offsets.size(); ++b)
            offsets[b] += offsets[b - 1];
        const std::size_t inside = offsets.back();
        std::vector<std::uint32_t> order(inside);
        std::vector<double> postX(inside), postY(inside);
        for (std::size_t k = 0; k < count; ++k) {
            if (keys[k] == kOutside)
                continue;
            const std::uint32_t slot = offsets[keys[k]]++;
            order[slot] = static_cast<std::uint32_t>(k);
            toPost(start + k, postX[slot], postY[slot]);
        }
        // offsets[b] now ends the slots of block b.
        for (std::uint32_t b = 0; b < blockCount; ++b) {
            for (std::size_t slot = b == 0 ? 0 : offsets[b - 1]; slot < offsets[b]; ++slot)
                heights[start + order[slot]] = evaluate(postX[slot], postY[slot], b);
        }
    }
}

}  // namespace detail
}  // namespace dem
}  // namespace kestrel
