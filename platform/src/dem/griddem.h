// A raster DEM as a grid of posts held in blocks, and its bilinear height queries.
#pragma once

#include <cstddef>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include <kestrel/dem.h>

#include "heightquery.h"

namespace kestrel {
namespace dem {
namespace detail {

// Leaves new elements uninitialised: posts are always written before they are read, and
// zeroing a block first would touch its memory twice.
template <class T>
struct UninitializedAllocator : std::allocator<T> {
    template <class U>
    struct rebind {
        using other = UninitializedAllocator<U>;
    };
    UninitializedAllocator() = default;
    template <class U>
    UninitializedAllocator(const UninitializedAllocator<U>&) noexcept {}
    template <class U>
    void construct(U* p) noexcept {
        ::new (static_cast<void*>(p)) U;
    }
    template <class U, class... A>
    void construct(U* p, A&&... args) {
        ::new (static_cast<void*>(p)) U(std::forward<A>(args)...);
    }
};

using Heights = std::vector<float, UninitializedAllocator<float>>;

// A rectangle of posts, row by row; NaN where a post has no height. Heights are final: any
// offset and scale of the stored values are applied.
struct PostBlock {
    unsigned int width = 0;
    unsigned int height = 0;
    Heights heights;
};

// Where the posts come from: the grid is cut into blocks of blockWidth x blockHeight posts
// (smaller at the right and bottom edges). GetBlock may be called from several threads at once.
class PostSource {
  public:
    virtual ~PostSource();
    PostSource(const PostSource&) = delete;
    PostSource& operator=(const PostSource&) = delete;

    virtual std::shared_ptr<const PostBlock> GetBlock(unsigned int blockX,
                                                      unsigned int blockY) const = 0;

    unsigned int width = 0, height = 0;
    unsigned int blockWidth = 0, blockHeight = 0;

  protected:
    PostSource() = default;
};

// The area of a grid that has heights, in pixel coordinates of the grid's geocoding.
struct PixelArea {
    double left, top, right, bottom;
};

class GridDEM : public IRasterDEM {
  public:
    // Heights exist over the whole raster, (0, 0) to (width, height) in pixel coordinates.
    GridDEM(std::unique_ptr<PostSource> posts, const ogc::cs::GeocodingInfo& geocoding,
            std::unique_ptr<ogc::cs::ICRS> crs, ogc::cs::DatumType datum, std::string name);
    // Heights exist over area only.
    GridDEM(std::unique_ptr<PostSource> posts, const ogc::cs::GeocodingInfo& geocoding,
            std::unique_ptr<ogc::cs::ICRS> crs, ogc::cs::DatumType datum, std::string name,
            const PixelArea& area);
    ~GridDEM() override;

    void SetOutputVerticalDatum(ogc::cs::DatumType datum) override { frame_.SetOutputDatum(datum); }
    ogc::cs::DatumType GetOutputVerticalDatum() const override { return frame_.GetOutputDatum(); }
    ogc::cs::DatumType GetVerticalDatum() const override { return frame_.GetDatum(); }
    const ogc::cs::ICRS* GetCRS() const override { return frame_.GetCRS(); }
    void GetExtent(double& minX, double& minY, double& maxX, double& maxY) const override;
    void SetInputCRS(const ogc::cs::ICRS* crs) override { frame_.SetInputCRS(crs); }
    void GetHeights(std::size_t n, const double* x, const double* y,
                    double* heights) const override;
    bool GetHeightRange(double minX, double minY, double maxX, double maxY, double& lowest,
                        double& highest) const override;
    bool CountPosts(double minX, double minY, double maxX, double maxY, std::size_t& posts,
                    std::size_t& holes) const override;

    unsigned int GetWidth() const override { return posts_->width; }
    unsigned int GetHeight() const override { return posts_->height; }
    const ogc::cs::GeocodingInfo* GetGeocoding() const override { return &geocoding_; }

  protected:
    // Bilinear heights at points in the grid's own coordinates, in the datum the posts hold.
    void Sample(std::size_t n, const double* x, const double* y, double* heights) const;

    // After the posts changed: the summaries of their heights are made again.
    void ForgetSummaries();

    std::unique_ptr<PostSource> posts_;
    ogc::cs::GeocodingInfo geocoding_;
    QueryFrame frame_;
    PixelArea area_;
    // The posts hold heights in the output datum already.
    bool postsConverted_ = false;

  private:
    // The lowest and highest post of each cell of kCell x kCell posts of a block, row by row
    // (NaN for a cell without a height), made the first time a range needs the block.
    static constexpr unsigned int kCell = 16;
    struct BlockSummary {
        unsigned int columns = 0;
        std::vector<float> low, high;
    };
    const BlockSummary& Summary(unsigned int blockX, unsigned int blockY) const;
    // The pixel rectangle of a rectangle of input coordinates, within the area with heights;
    // false when they do not meet.
    bool PixelWindow(double minX, double minY, double maxX, double maxY, PixelArea& window) const;

    mutable std::mutex summaryMutex_;
    mutable std::vector<std::unique_ptr<BlockSummary>> summaries_;
};

}  // namespace detail
}  // namespace dem
}  // namespace kestrel
