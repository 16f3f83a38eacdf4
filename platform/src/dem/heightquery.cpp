#include "heightquery.h"

#include <algorithm>
#include <cmath>
#include <utility>

#include <ogr_spatialref.h>

#include <kestrel/exception.h>

namespace kestrel {
namespace dem {
namespace detail {

using ogc::cs::CoordinateTransformation;
using ogc::cs::DatumType;
using ogc::cs::ICRS;

TransformPool::TransformPool(const ICRS& from, const ICRS& to) : prototype_(from, to) {}

TransformPool::~TransformPool() = default;

std::unique_ptr<CoordinateTransformation> TransformPool::Acquire() const {
    std::lock_guard<std::mutex> lock(mutex_);
    if (idle_.empty())
        return std::make_unique<CoordinateTransformation>(prototype_);
    auto transform = std::move(idle_.back());
    idle_.pop_back();
    return transform;
}

void TransformPool::Release(std::unique_ptr<CoordinateTransformation> transform) const {
    std::lock_guard<std::mutex> lock(mutex_);
    idle_.push_back(std::move(transform));
}

void TransformPool::Transform(std::size_t n, double* x, double* y, double* z) const {
    auto transform = Acquire();
    struct Returner {
        const TransformPool* pool;
        std::unique_ptr<CoordinateTransformation>& transform;
        ~Returner() { pool->Release(std::move(transform)); }
    } returner{this, transform};
    transform->Transform(n, x, y, z);
}

// ---------------------------------------------------------------------------------------------

ShiftLattice::ShiftLattice(const TransformPool& vertical, double fromUnit, double toUnit,
                           double spacing)
    : vertical_(vertical), fromUnit_(fromUnit), toUnit_(toUnit), spacing_(spacing) {}

const ShiftLattice::Block& ShiftLattice::BlockAt(long long bx, long long by) const {
    std::lock_guard<std::mutex> lock(mutex_);
    std::unique_ptr<Block>& block = blocks_[{bx, by}];
    if (block)
        return *block;
    // Each node converted at two heights: the change is taken only where it is the same shift
    // for both (a geoid model's), else NaN.
    constexpr int kSide = kBlock + 1;
    constexpr double kHigh = 1000.0;  // metres
    std::vector<double> x, y, z;
    for (int j = 0; j < kSide; ++j)
        for (int i = 0; i < kSide; ++i)
            for (const double h : {0.0, kHigh}) {
                x.push_back(static_cast<double>(bx * kBlock + i) * spacing_);
                y.push_back(static_cast<double>(by * kBlock + j) * spacing_);
                z.push_back(h / fromUnit_);
            }
    vertical_.Transform(x.size(), x.data(), y.data(), z.data());
    block = std::make_unique<Block>(static_cast<std::size_t>(kSide) * kSide);
    for (std::size_t k = 0; k < block->size(); ++k) {
        const double low = z[2 * k] * toUnit_, high = z[2 * k + 1] * toUnit_ - kHigh;
        (*block)[k] = std::fabs(high - low) <= 1e-6 ? low : NAN;
    }
    return *block;
}

void ShiftLattice::Shift(const std::vector<std::size_t>& points, const double* x,
                         const double* y, double* heights, std::vector<std::size_t>& left) const {
    const Block* block = nullptr;
    long long blockX = 0, blockY = 0;
    for (const std::size_t p : points) {
        const double u = x[p] / spacing_, v = y[p] / spacing_;
        if (!(std::fabs(u) < 1e15 && std::fabs(v) < 1e15)) {
            left.push_back(p);
            continue;
        }
        const double fu = std::floor(u), fv = std::floor(v);
        const auto i = static_cast<long long>(fu), j = static_cast<long long>(fv);
        // Floor division: the block holding cell (i, j).
        const long long bx = i >= 0 ? i / kBlock : -((-i + kBlock - 1) / kBlock);
        const long long by = j >= 0 ? j / kBlock : -((-j + kBlock - 1) / kBlock);
        if (block == nullptr || bx != blockX || by != blockY)
            block = &BlockAt(bx, by), blockX = bx, blockY = by;
        const std::size_t k = static_cast<std::size_t>(j - by * kBlock) * (kBlock + 1) +
                              static_cast<std::size_t>(i - bx * kBlock);
        const double a = u - fu, b = v - fv;
        const Block& n = *block;
        const double shift = (1 - b) * ((1 - a) * n[k] + a * n[k + 1]) +
                             b * ((1 - a) * n[k + kBlock + 1] + a * n[k + kBlock + 2]);
        if (std::isfinite(shift))
            heights[p] += shift;
        else
            left.push_back(p);
    }
}

// ---------------------------------------------------------------------------------------------

std::string DatumName(DatumType datum) {
    switch (datum) {
        case ogc::cs::DatumMSL:
            return "MSL";
        case ogc::cs::DatumEllipsoid:
            return "ELLIPS";
        case ogc::cs::DatumMathModel:
            return "MATHMODEL";
    }
    return std::to_string(static_cast<int>(datum));
}

namespace {

bool IsKnownDatum(DatumType datum) {
    return datum == ogc::cs::DatumMSL || datum == ogc::cs::DatumEllipsoid ||
           datum == ogc::cs::DatumMathModel;
}

// The horizontal part of a coordinate system, two-dimensional.
OGRSpatialReference Horizontal(const ICRS& crs) {
    OGRSpatialReference srs(crs.GetSpatialReference());
    if (srs.IsCompound())
        srs.StripVertical();
    if (srs.GetAxesCount() == 3)
        srs.DemoteTo2D(nullptr);
    return srs;
}

// The source's coordinates with heights above mean sea level: its own system when that has a
// gravity-related vertical part, otherwise its horizontal part with EGM96 heights.
ICRS MeanSeaLevelCRS(const ICRS& crs) {
    if (crs.IsCompound())
        return crs;
    const OGRSpatialReference horizontal = Horizontal(crs);
    OGRSpatialReference egm96;
    egm96.importFromEPSG(5773);
    OGRSpatialReference compound;
    compound.SetCompoundCS((std::string(horizontal.GetName()) + " + EGM96 height").c_str(),
                           &horizontal, &egm96);
    return ICRS(compound);
}

// The source's coordinates with heights above the ellipsoid of its horizontal datum.
ICRS EllipsoidalCRS(const ICRS& crs) {
    OGRSpatialReference srs = Horizontal(crs);
    srs.PromoteTo3D(nullptr);
    return ICRS(srs);
}

}  // namespace

QueryFrame::QueryFrame(std::unique_ptr<ICRS> crs, DatumType datum, std::string name)
    : crs_(std::move(crs)), datum_(datum), output_(datum), name_(std::move(name)) {
    if (!IsKnownDatum(datum)) {
        KESTREL_THROW(DataException,
                      FormatString("%s: unknown vertical datum %d (expected 2000 MATHMODEL, 2001 "
                                   "MSL or 2002 ELLIPS)",
                                   name_.c_str(), static_cast<int>(datum)));
    }
}

QueryFrame::~QueryFrame() = default;

void QueryFrame::SetOutputDatum(DatumType datum) {
    if (!IsKnownDatum(datum)) {
        KESTREL_THROW(DataException,
                      FormatString("%s: unknown output vertical datum %d (expected 2000 "
                                   "MATHMODEL, 2001 MSL or 2002 ELLIPS)",
                                   name_.c_str(), static_cast<int>(datum)));
    }
    lattice_.reset();  // it refers to vertical_
    if (datum == datum_) {
        vertical_.reset();
        output_ = datum;
        return;
    }
    if (datum == ogc::cs::DatumMathModel || datum_ == ogc::cs::DatumMathModel) {
        KESTREL_THROW(
            DataException,
            FormatString("%s: heights in the %s datum cannot be delivered in the %s "
                         "datum: the math model's datum is not known to the DEM",
                         name_.c_str(), DatumName(datum_).c_str(), DatumName(datum).c_str()));
    }
    if (!crs_) {
        KESTREL_THROW(
            DataException,
            FormatString("%s has no coordinate system, so its %s heights cannot be "
                         "converted to %s",
                         name_.c_str(), DatumName(datum_).c_str(), DatumName(datum).c_str()));
    }
    const ICRS msl = MeanSeaLevelCRS(*crs_);
    const ICRS ellipsoidal = EllipsoidalCRS(*crs_);
    // Heights are held in metres; PROJ takes and gives them in the units of the two systems.
    const double mslUnit = ogc::utils::GetVerticalReference(&msl).metresPerUnit;
    const double ellipsoidalUnit = ogc::utils::GetVerticalReference(&ellipsoidal).metresPerUnit;
    fromUnit_ = datum == ogc::cs::DatumEllipsoid ? mslUnit : ellipsoidalUnit;
    toUnit_ = datum == ogc::cs::DatumEllipsoid ? ellipsoidalUnit : mslUnit;
    try {
        vertical_ = datum == ogc::cs::DatumEllipsoid
                        ? std::make_unique<TransformPool>(msl, ellipsoidal)
                        : std::make_unique<TransformPool>(ellipsoidal, msl);
    } catch (const DataException& e) {
        KESTREL_THROW(
            DataException,
            FormatString("%s: heights cannot be converted from %s to %s: %s", name_.c_str(),
                         DatumName(datum_).c_str(), DatumName(datum).c_str(), e.what()));
    }
    // Nodes about every 100 m: against PROJ on the steepest changes of the geoid's slope
    // (EGM96 in the Himalaya) within 1 mm (500 m: within 6 mm).
    const double spacing = crs_->IsGeographic()
                               ? 1.0 / 1024.0
                               : 100.0 / crs_->GetSpatialReference().GetLinearUnits(nullptr);
    lattice_ = std::make_unique<ShiftLattice>(*vertical_, fromUnit_, toUnit_, spacing);
    output_ = datum;
}

void QueryFrame::SetInputCRS(const ICRS* crs) {
    if (crs == nullptr || (crs_ && crs->IsSame(*crs_))) {
        input_.reset();
        return;
    }
    if (!crs_) {
        KESTREL_THROW(DataException,
                      FormatString("%s has no coordinate system, so points in \"%s\" cannot be "
                                   "taken into it",
                                   name_.c_str(), crs->GetName().c_str()));
    }
    input_ = std::make_unique<TransformPool>(*crs, *crs_);
}

void QueryFrame::CheckFinite(std::size_t n, const double* x, const double* y) const {
    for (std::size_t i = 0; i < n; ++i) {
        if (!std::isfinite(x[i]) || !std::isfinite(y[i])) {
            KESTREL_THROW(DataException,
                          FormatString("%s: height asked at a point that is not finite: point "
                                       "%zu is (%g, %g)",
                                       name_.c_str(), i, x[i], y[i]));
        }
    }
}

void QueryFrame::ConvertHeights(std::size_t n, const double* x, const double* y,
                                double* heights) const {
    if (!vertical_)
        return;
    // Points with a height take the lattice's change; those it cannot say go through PROJ, in
    // chunks that stay in the processor's cache.
    std::vector<std::size_t> points, left;
    for (std::size_t i = 0; i < n; ++i) {
        if (!std::isnan(heights[i]))
            points.push_back(i);
    }
    lattice_->Shift(points, x, y, heights, left);
    constexpr std::size_t chunk = 4096;
    std::vector<double> cx, cy, cz;
    for (std::size_t start = 0; start < left.size(); start += chunk) {
        const std::size_t end = std::min(left.size(), start + chunk);
        cx.clear(), cy.clear(), cz.clear();
        for (std::size_t k = start; k < end; ++k) {
            cx.push_back(x[left[k]]);
            cy.push_back(y[left[k]]);
            cz.push_back(heights[left[k]] / fromUnit_);
        }
        vertical_->Transform(cx.size(), cx.data(), cy.data(), cz.data());
        for (std::size_t k = start; k < end; ++k)
            heights[left[k]] = cz[k - start] * toUnit_;
    }
}

bool QueryFrame::OwnRectangle(double& minX, double& minY, double& maxX, double& maxY) const {
    if (!(minX <= maxX && minY <= maxY) || !std::isfinite(minX + minY + maxX + maxY))
        return false;
    if (!input_)
        return true;
    // Eight points an edge: the own rectangle of a curved edge is then close to its true one.
    constexpr int kSteps = 8;
    std::vector<double> x, y;
    for (int k = 0; k < kSteps; ++k) {
        const double t = static_cast<double>(k) / kSteps;
        const double ax = minX + t * (maxX - minX), ay = minY + t * (maxY - minY);
        const double bx = maxX - t * (maxX - minX), by = maxY - t * (maxY - minY);
        x.insert(x.end(), {ax, maxX, bx, minX});
        y.insert(y.end(), {minY, ay, maxY, by});
    }
    input_->Transform(x.size(), x.data(), y.data(), nullptr);
    double x0 = INFINITY, y0 = INFINITY, x1 = -INFINITY, y1 = -INFINITY;
    for (std::size_t i = 0; i < x.size(); ++i) {
        if (!std::isfinite(x[i]) || !std::isfinite(y[i]))
            continue;
        x0 = std::min(x0, x[i]), x1 = std::max(x1, x[i]);
        y0 = std::min(y0, y[i]), y1 = std::max(y1, y[i]);
    }
    if (!(x0 <= x1 && y0 <= y1))
        return false;
    minX = x0, minY = y0, maxX = x1, maxY = y1;
    return true;
}

void QueryFrame::WidenToOutput(double minX, double minY, double maxX, double maxY, double& low,
                               double& high) const {
    if (!vertical_)
        return;
    // The change of datum is smooth: a 5 x 5 lattice finds its extremes on a tile's area.
    constexpr int kSide = 5;
    std::vector<double> x, y, shiftLow, shiftHigh;
    for (int j = 0; j < kSide; ++j) {
        for (int i = 0; i < kSide; ++i) {
            x.push_back(minX + (maxX - minX) * i / (kSide - 1));
            y.push_back(minY + (maxY - minY) * j / (kSide - 1));
        }
    }
    shiftLow.assign(x.size(), low);
    shiftHigh.assign(x.size(), high);
    ConvertHeights(x.size(), x.data(), y.data(), shiftLow.data());
    ConvertHeights(x.size(), x.data(), y.data(), shiftHigh.data());
    double newLow = INFINITY, newHigh = -INFINITY;
    for (std::size_t i = 0; i < x.size(); ++i) {
        if (std::isfinite(shiftLow[i]))
            newLow = std::min(newLow, shiftLow[i]);
        if (std::isfinite(shiftHigh[i]))
            newHigh = std::max(newHigh, shiftHigh[i]);
    }
    if (newLow <= newHigh)
        low = newLow, high = newHigh;
    else
        low = high = NAN;
}

}  // namespace detail
}  // namespace dem
}  // namespace kestrel
