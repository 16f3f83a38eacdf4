#include "constantdem.h"

#include <cmath>
#include <utility>
#include <vector>

#include <kestrel/exception.h>

#include "griddem.h"
#include "memoryposts.h"

namespace kestrel {
namespace dem {

namespace {

// The heights of a constant DEM stand at few posts; converted into another datum they follow the
// geoid, bilinear between the posts.
class ConstantDEM final : public detail::GridDEM {
  public:
    ConstantDEM(std::unique_ptr<detail::MemoryPosts> posts, const ogc::cs::GeocodingInfo& grid,
                std::unique_ptr<ogc::cs::ICRS> crs, ogc::cs::DatumType datum,
                const detail::PixelArea& area, float constantHeight)
        : GridDEM(std::move(posts), grid, std::move(crs), datum, "constant DEM", area),
          constantHeight_(constantHeight) {
        postsConverted_ = true;
    }

    void SetOutputVerticalDatum(ogc::cs::DatumType datum) override {
        frame_.SetOutputDatum(datum);
        const unsigned int columns = posts_->width, rows = posts_->height;
        const std::size_t count = static_cast<std::size_t>(columns) * rows;
        std::vector<double> x(count), y(count), h(count, constantHeight_);
        for (unsigned int j = 0; j < rows; ++j) {
            for (unsigned int i = 0; i < columns; ++i) {
                const std::size_t k = static_cast<std::size_t>(j) * columns + i;
                geocoding_.PixelToGround(i + 0.5, j + 0.5, x[k], y[k]);
            }
        }
        frame_.ConvertHeights(count, x.data(), y.data(), h.data());
        auto block = std::make_shared<detail::PostBlock>();
        block->width = columns;
        block->height = rows;
        block->heights.assign(h.begin(), h.end());
        static_cast<detail::MemoryPosts&>(*posts_).Replace(std::move(block));
        ForgetSummaries();
    }

  private:
    float constantHeight_;
};

}  // namespace

std::unique_ptr<IRasterDEM> MakeConstantDEM(const ogc::cs::ICRS* crs,
                                            const ogc::cs::GeocodingInfo* geocoding,
                                            unsigned int width, unsigned int height,
                                            float constantHeight, ogc::cs::DatumType datum,
                                            float downsampling) {
    if (geocoding == nullptr)
        KESTREL_THROW(DataException, "A constant DEM needs the geocoding of its grid; none given");
    if (width == 0 || height == 0) {
        KESTREL_THROW(DataException,
                      FormatString("A constant DEM needs a grid of at least one pixel; %u x %u "
                                   "given",
                                   width, height));
    }
    if (!std::isfinite(constantHeight)) {
        KESTREL_THROW(DataException,
                      FormatString("The height of a constant DEM must be finite; %g given",
                                   static_cast<double>(constantHeight)));
    }
    if (!(downsampling >= 1.0f) || !std::isfinite(downsampling)) {
        KESTREL_THROW(DataException,
                      FormatString("The post spacing of a constant DEM must be at least 1 pixel; "
                                   "%g given",
                                   static_cast<double>(downsampling)));
    }
    const double step = downsampling;
    const double columns = std::ceil(width / step) + 1.0, rows = std::ceil(height / step) + 1.0;
    if (columns * rows > double(1 << 28)) {
        KESTREL_THROW(DataException,
                      FormatString("A constant DEM of %u x %u pixels with a post every %g pixels "
                                   "needs too many posts (%.0f)",
                                   width, height, step, columns * rows));
    }
    // Post (i, j) stands on grid pixel coordinates (i step, j step): the grid's geotransform
    // scaled by step and shifted by half a post.
    const auto& g = geocoding->GetGeoTransform();
    const ogc::cs::GeocodingInfo posts({g[0] - 0.5 * step * (g[1] + g[2]), step * g[1], step * g[2],
                                        g[3] - 0.5 * step * (g[4] + g[5]), step * g[4],
                                        step * g[5]});
    const detail::PixelArea area{0.5, 0.5, width / step + 0.5, height / step + 0.5};

    auto block = std::make_shared<detail::PostBlock>();
    block->width = static_cast<unsigned int>(columns);
    block->height = static_cast<unsigned int>(rows);
    block->heights.assign(static_cast<std::size_t>(columns * rows), constantHeight);
    std::unique_ptr<ogc::cs::ICRS> ownCrs(crs != nullptr ? crs->Clone() : nullptr);
    return std::make_unique<ConstantDEM>(std::make_unique<detail::MemoryPosts>(std::move(block)),
                                         posts, std::move(ownCrs), datum, area, constantHeight);
}

}  // namespace dem
}  // namespace kestrel
