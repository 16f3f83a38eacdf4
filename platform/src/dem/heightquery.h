// What every elevation source does around its own sampling: ground points taken from the
// caller's coordinate system into the source's own, and heights taken from the source's
// vertical datum into the output datum.
#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include <kestrel/crs.h>

namespace kestrel {
namespace dem {
namespace detail {

// Copies of one coordinate transformation for as many threads as use it at once: PROJ's
// objects are not shared between threads.
class TransformPool {
  public:
    // Throws DataException when PROJ has no transformation without a ballpark step.
    TransformPool(const ogc::cs::ICRS& from, const ogc::cs::ICRS& to);
    ~TransformPool();
    TransformPool(const TransformPool&) = delete;
    TransformPool& operator=(const TransformPool&) = delete;

    // Transforms in place; points that fail become NaN.
    void Transform(std::size_t n, double* x, double* y, double* z) const;

  private:
    std::unique_ptr<ogc::cs::CoordinateTransformation> Acquire() const;
    void Release(std::unique_ptr<ogc::cs::CoordinateTransformation> transform) const;

    const ogc::cs::CoordinateTransformation prototype_;
    mutable std::mutex mutex_;
    mutable std::vector<std::unique_ptr<ogc::cs::CoordinateTransformation>> idle_;
};

// The change of vertical datum (metres added to a height) on a lattice of points of the source's
// own coordinates, interpolated bilinearly between them: a geoid model is a grid of 15' (EGM96)
// or finer that PROJ interpolates, so that a lattice of a small fraction of that spacing agrees
// with PROJ to within a millimetre at a small share of its cost. Nodes are computed through PROJ
// when first needed, in blocks; a node where the change is not a shift of the height alone
// (or PROJ cannot convert) leaves the points around it to PROJ.
class ShiftLattice {
  public:
    // spacing: between nodes, in the source's own units.
    ShiftLattice(const TransformPool& vertical, double fromUnit, double toUnit, double spacing);
    // Adds the change at each point to heights[i] for the points listed in `points`, and lists
    // in `left` those the lattice cannot say. Thread-safe.
    void Shift(const std::vector<std::size_t>& points, const double* x, const double* y,
               double* heights, std::vector<std::size_t>& left) const;

  private:
    static constexpr int kBlock = 32;  // cells of a block on a side (kBlock + 1 nodes)
    using Block = std::vector<double>;
    const Block& BlockAt(long long bx, long long by) const;

    const TransformPool& vertical_;
    const double fromUnit_, toUnit_, spacing_;
    mutable std::mutex mutex_;
    mutable std::map<std::pair<long long, long long>, std::unique_ptr<Block>> blocks_;
};

// The coordinate systems and datums of one elevation source, and the transformations between
// them. Queries are const and thread-safe; the setters are not meant to run during queries.
class QueryFrame {
  public:
    // crs may be null (a source without a coordinate system); name says what the source is in
    // messages (its path).
    QueryFrame(std::unique_ptr<ogc::cs::ICRS> crs, ogc::cs::DatumType datum, std::string name);
    ~QueryFrame();

    const ogc::cs::ICRS* GetCRS() const { return crs_.get(); }
    ogc::cs::DatumType GetDatum() const { return datum_; }
    ogc::cs::DatumType GetOutputDatum() const { return output_; }

    // Throws DataException when heights cannot be taken from the source's datum into datum.
    void SetOutputDatum(ogc::cs::DatumType datum);
    void SetInputCRS(const ogc::cs::ICRS* crs);

    // Heights at n points of the caller: sample(n, x, y, heights) fills the heights at points in
    // the source's own coordinates (NaN where there is none); they are then converted into the
    // output datum. Throws DataException for a coordinate that is not finite.
    // convert false leaves the heights in the datum the sampler delivers them in (a source that
    // holds its posts converted already).
    template <class Sample>
    void Query(std::size_t n, const double* x, const double* y, double* heights, Sample&& sample,
               bool convert = true) const {
        CheckFinite(n, x, y);
        std::vector<double> ownX, ownY;
        if (input_) {
            ownX.assign(x, x + n);
            ownY.assign(y, y + n);
            input_->Transform(n, ownX.data(), ownY.data(), nullptr);
            x = ownX.data();
            y = ownY.data();
        }
        sample(n, x, y, heights);
        if (convert)
            ConvertHeights(n, x, y, heights);
    }

    // Takes heights at points in the source's own coordinates from its datum into the output
    // datum; NaN stays NaN, and a point PROJ cannot convert becomes NaN.
    void ConvertHeights(std::size_t n, const double* x, const double* y, double* heights) const;

    // The rectangle of the source's own coordinates that holds the caller's rectangle (its
    // edges taken through the input transformation at several points each); false when it has
    // no finite point.
    bool OwnRectangle(double& minX, double& minY, double& maxX, double& maxY) const;

    // Widens a range of heights in the source's datum over a rectangle of own coordinates into
    // the output datum: by the lowest and highest change of datum at a lattice of points on it.
    void WidenToOutput(double minX, double minY, double maxX, double maxY, double& low,
                       double& high) const;

  private:
    void CheckFinite(std::size_t n, const double* x, const double* y) const;

    std::unique_ptr<ogc::cs::ICRS> crs_;
    ogc::cs::DatumType datum_;
    ogc::cs::DatumType output_;
    std::string name_;
    std::unique_ptr<TransformPool> input_;
    std::unique_ptr<TransformPool> vertical_;
    std::unique_ptr<ShiftLattice> lattice_;
    double fromUnit_ = 1.0, toUnit_ = 1.0;  // metres per unit of the heights PROJ takes and gives
};

// The name of a datum in messages: "MSL", "ELLIPS" or "MATHMODEL", or its number.
std::string DatumName(ogc::cs::DatumType datum);

}  // namespace detail
}  // namespace dem
}  // namespace kestrel
