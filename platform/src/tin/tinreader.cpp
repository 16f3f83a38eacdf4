#include "tinreader.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <limits>
#include <utility>
#include <vector>

#include <gdal_priv.h>
#include <ogr_geometry.h>
#include <ogrsf_frmts.h>

#include <kestrel/exception.h>

#include "../dem/heightquery.h"
#include <kestrel/gdalsupport.h>

namespace kestrel {
namespace tin {

namespace {

struct Triangle {
    std::array<double, 3> x, y, z;
};

// What a layer holds that makes a surface.
struct SurfaceData {
    std::vector<Triangle> triangles;
    OGRMultiPoint points;
};

// Triangles in a grid of about one cell per two triangles, each cell listing the triangles that
// meet it. The grid spans the bulk of the vertices (between the 10th and 90th percentiles, and a
// quarter of that beyond each, within the vertices' extent), so that a far outlier point (and
// the long triangles that join it to the rest) does not spread the cells of the rest thin;
// whatever lies beyond belongs to the border cells. A triangle is
// listed in the cells it meets row by row, not in those of its bounding box, so that a long
// sliver costs its length in cells, not its box's area.
class TriangleIndex {
  public:
    explicit TriangleIndex(std::vector<Triangle> triangles) : triangles_(std::move(triangles)) {
        fullMinX_ = fullMinY_ = std::numeric_limits<double>::infinity();
        fullMaxX_ = fullMaxY_ = -fullMinX_;
        std::vector<double> vx, vy;
        vx.reserve(3 * triangles_.size());
        vy.reserve(3 * triangles_.size());
        for (const auto& t : triangles_) {
            for (int k = 0; k < 3; ++k) {
                fullMinX_ = std::min(fullMinX_, t.x[k]), fullMaxX_ = std::max(fullMaxX_, t.x[k]);
                fullMinY_ = std::min(fullMinY_, t.y[k]), fullMaxY_ = std::max(fullMaxY_, t.y[k]);
                vx.push_back(t.x[k]);
                vy.push_back(t.y[k]);
            }
        }
        Bulk(vx, fullMinX_, fullMaxX_, minX_, maxX_);
        Bulk(vy, fullMinY_, fullMaxY_, minY_, maxY_);
        // About two triangles a cell.
        const double side = std::max(1.0, std::sqrt(triangles_.size() / 2.0));
        const double w = std::max(maxX_ - minX_, 1e-9), h = std::max(maxY_ - minY_, 1e-9);
        const double aspect = std::sqrt(w / h);
        columns_ = static_cast<std::size_t>(std::clamp(side * aspect, 1.0, 4096.0));
        rows_ = static_cast<std::size_t>(std::clamp(side / aspect, 1.0, 4096.0));
        cellW_ = w / columns_;
        cellH_ = h / rows_;
        std::vector<std::size_t> counts(columns_ * rows_ + 1, 0);
        ForEachCell([&](std::size_t, std::size_t cell) { ++counts[cell + 1]; });
        for (std::size_t c = 1; c < counts.size(); ++c)
            counts[c] += counts[c - 1];
        start_ = counts;
        members_.resize(counts.back());
        low_.assign(columns_ * rows_, INFINITY);
        high_.assign(columns_ * rows_, -INFINITY);
        ForEachCell([&](std::size_t t, std::size_t cell) {
            members_[counts[cell]++] = static_cast<std::uint32_t>(t);
            const auto [z0, z1] =
                std::minmax({triangles_[t].z[0], triangles_[t].z[1], triangles_[t].z[2]});
            low_[cell] = std::min(low_[cell], z0);
            high_[cell] = std::max(high_[cell], z1);
        });
    }

    // The height at (x, y), NaN outside every triangle.
    double HeightAt(double x, double y) const {
        if (!(x >= fullMinX_ && x <= fullMaxX_ && y >= fullMinY_ && y <= fullMaxY_))
            return NAN;
        const std::size_t cell = Row(y) * columns_ + Column(x);
        for (std::size_t k = start_[cell]; k < start_[cell + 1]; ++k) {
            double z;
            if (Interpolate(triangles_[members_[k]], x, y, z))
                return z;
        }
        return NAN;
    }

    // The lowest and highest vertex of the triangles listed in the cells that meet the
    // rectangle; false when there is none.
    bool HeightRange(double minX, double minY, double maxX, double maxY, double& low,
                     double& high) const {
        minX = std::max(minX, fullMinX_), maxX = std::min(maxX, fullMaxX_);
        minY = std::max(minY, fullMinY_), maxY = std::min(maxY, fullMaxY_);
        if (!(minX <= maxX && minY <= maxY))
            return false;
        low = INFINITY, high = -INFINITY;
        for (std::size_t r = Row(minY); r <= Row(maxY); ++r) {
            for (std::size_t c = Column(minX); c <= Column(maxX); ++c) {
                low = std::min(low, low_[r * columns_ + c]);
                high = std::max(high, high_[r * columns_ + c]);
            }
        }
        return low <= high;
    }

    std::size_t Count() const { return triangles_.size(); }
    // The largest number of triangles a cell lists: what a lookup costs at worst.
    std::size_t LargestCell() const {
        std::size_t largest = 0;
        for (std::size_t c = 0; c + 1 < start_.size(); ++c)
            largest = std::max(largest, start_[c + 1] - start_[c]);
        return largest;
    }
    void Extent(double& minX, double& minY, double& maxX, double& maxY) const {
        minX = fullMinX_, minY = fullMinY_, maxX = fullMaxX_, maxY = fullMaxY_;
    }

  private:
    // The span of the bulk of values: the 10th to the 90th percentile widened by a quarter of
    // its length on each side, within [lowest, highest].
    static void Bulk(std::vector<double>& values, double lowest, double highest, double& low,
                     double& high) {
        if (values.empty()) {
            low = high = 0.0;
            return;
        }
        const std::size_t cut = values.size() / 10;
        std::nth_element(values.begin(), values.begin() + cut, values.end());
        const double q10 = values[cut];
        std::nth_element(values.begin(), values.end() - 1 - cut, values.end());
        const double q90 = values[values.size() - 1 - cut];
        low = std::max(lowest, q10 - 0.25 * (q90 - q10));
        high = std::min(highest, q90 + 0.25 * (q90 - q10));
    }

    // Calls f(triangle, cell) for each cell a triangle meets, the border cells reaching to
    // infinity.
    template <class F>
    void ForEachCell(F&& f) const {
        const double padX = 1e-9 * cellW_, padY = 1e-9 * cellH_;
        for (std::size_t t = 0; t < triangles_.size(); ++t) {
            const Triangle& tri = triangles_[t];
            const auto [y0, y1] = std::minmax({tri.y[0], tri.y[1], tri.y[2]});
            for (std::size_t r = Row(y0 - padY); r <= Row(y1 + padY); ++r) {
                const double bandLow = r == 0 ? -INFINITY : minY_ + r * cellH_ - padY;
                const double bandHigh = r + 1 == rows_ ? INFINITY : minY_ + (r + 1) * cellH_ + padY;
                // The triangle's x span within the band: its corners inside the band and the
                // crossings of its edges with the band's edges.
                double lo = INFINITY, hi = -INFINITY;
                for (int k = 0; k < 3; ++k) {
                    const int m = (k + 1) % 3;
                    if (tri.y[k] >= bandLow && tri.y[k] <= bandHigh)
                        lo = std::min(lo, tri.x[k]), hi = std::max(hi, tri.x[k]);
                    for (double bound : {bandLow, bandHigh}) {
                        if (std::isfinite(bound) && (tri.y[k] - bound) * (tri.y[m] - bound) < 0) {
                            const double x = tri.x[k] + (bound - tri.y[k]) * (tri.x[m] - tri.x[k]) /
                                                            (tri.y[m] - tri.y[k]);
                            lo = std::min(lo, x), hi = std::max(hi, x);
                        }
                    }
                }
                if (!(lo <= hi))
                    continue;
                for (std::size_t c = Column(lo - padX); c <= Column(hi + padX); ++c)
                    f(t, r * columns_ + c);
            }
        }
    }
    std::size_t Column(double x) const {
        return static_cast<std::size_t>(
            std::clamp((x - minX_) / cellW_, 0.0, static_cast<double>(columns_ - 1)));
    }
    std::size_t Row(double y) const {
        return static_cast<std::size_t>(
            std::clamp((y - minY_) / cellH_, 0.0, static_cast<double>(rows_ - 1)));
    }

    // Barycentric interpolation; points on an edge (within rounding) belong to the triangle.
    static bool Interpolate(const Triangle& t, double x, double y, double& z) {
        const double d =
            (t.y[1] - t.y[2]) * (t.x[0] - t.x[2]) + (t.x[2] - t.x[1]) * (t.y[0] - t.y[2]);
        const double a = ((t.y[1] - t.y[2]) * (x - t.x[2]) + (t.x[2] - t.x[1]) * (y - t.y[2])) / d;
        const double b = ((t.y[2] - t.y[0]) * (x - t.x[2]) + (t.x[0] - t.x[2]) * (y - t.y[2])) / d;
        const double c = 1.0 - a - b;
        constexpr double eps = -1e-12;
        if (a < eps || b < eps || c < eps)
            return false;
        z = a * t.z[0] + b * t.z[1] + c * t.z[2];
        return true;
    }

    std::vector<Triangle> triangles_;
    double fullMinX_, fullMinY_, fullMaxX_, fullMaxY_;  // of every vertex
    double minX_ = 0, minY_ = 0, maxX_ = 0, maxY_ = 0;  // of the grid
    std::size_t columns_ = 1, rows_ = 1;
    double cellW_ = 1, cellH_ = 1;
    std::vector<std::size_t> start_;
    std::vector<std::uint32_t> members_;
    std::vector<double> low_, high_;  // per cell: lowest and highest vertex of its triangles
};

class OgrTinReader final : public TinReader {
  public:
    OgrTinReader(TriangleIndex index, std::unique_ptr<ogc::cs::ICRS> crs, ogc::cs::DatumType datum,
                 const std::string& name)
        : index_(std::move(index)), frame_(std::move(crs), datum, name) {}

    void SetOutputVerticalDatum(ogc::cs::DatumType datum) override { frame_.SetOutputDatum(datum); }
    ogc::cs::DatumType GetOutputVerticalDatum() const override { return frame_.GetOutputDatum(); }
    ogc::cs::DatumType GetVerticalDatum() const override { return frame_.GetDatum(); }
    const ogc::cs::ICRS* GetCRS() const override { return frame_.GetCRS(); }
    void GetExtent(double& minX, double& minY, double& maxX, double& maxY) const override {
        index_.Extent(minX, minY, maxX, maxY);
    }
    void SetInputCRS(const ogc::cs::ICRS* crs) override { frame_.SetInputCRS(crs); }
    std::size_t GetTriangleCount() const override { return index_.Count(); }
    std::size_t GetLargestCell() const { return index_.LargestCell(); }

    bool GetHeightRange(double minX, double minY, double maxX, double maxY, double& lowest,
                        double& highest) const override {
        double low, high;
        if (!frame_.OwnRectangle(minX, minY, maxX, maxY) ||
            !index_.HeightRange(minX, minY, maxX, maxY, low, high))
            return false;
        frame_.WidenToOutput(minX, minY, maxX, maxY, low, high);
        if (!(low <= high))
            return false;
        lowest = low, highest = high;
        return true;
    }

    void GetHeights(std::size_t n, const double* x, const double* y,
                    double* heights) const override {
        frame_.Query(n, x, y, heights,
                     [this](std::size_t m, const double* gx, const double* gy, double* h) {
                         for (std::size_t i = 0; i < m; ++i)
                             h[i] = index_.HeightAt(gx[i], gy[i]);
                     });
    }

  private:
    TriangleIndex index_;
    dem::detail::QueryFrame frame_;
};

// Collects the triangles and 3-D points of a geometry, taking collections apart. The result is
// what makes it unusable, or empty.
std::string Collect(const OGRGeometry& g, SurfaceData& out) {
    const OGRwkbGeometryType type = wkbFlatten(g.getGeometryType());
    if (type == wkbPoint) {
        if (!g.Is3D())
            return "a point without a height";
        // A point without a finite position or height is no-data.
        const auto& point = static_cast<const OGRPoint&>(g);
        if (std::isfinite(point.getX()) && std::isfinite(point.getY()) &&
            std::isfinite(point.getZ()))
            out.points.addGeometry(&g);
        return "";
    }
    if (type == wkbPolygon || type == wkbTriangle) {
        const auto& polygon = static_cast<const OGRPolygon&>(g);
        const OGRLinearRing* ring = polygon.getExteriorRing();
        if (ring == nullptr || ring->getNumPoints() != 4 || polygon.getNumInteriorRings() != 0)
            return "a polygon that is not a triangle";
        if (!g.Is3D())
            return "a triangle without heights";
        Triangle t;
        for (int k = 0; k < 3; ++k) {
            t.x[k] = ring->getX(k), t.y[k] = ring->getY(k), t.z[k] = ring->getZ(k);
        }
        const double area =
            (t.x[1] - t.x[0]) * (t.y[2] - t.y[0]) - (t.x[2] - t.x[0]) * (t.y[1] - t.y[0]);
        // A flat or non-finite triangle, or one with a non-finite height, holds no height.
        if (area != 0.0 && std::isfinite(area) && std::isfinite(t.z[0] + t.z[1] + t.z[2]))
            out.triangles.push_back(t);
        return "";
    }
    if (type == wkbTIN || type == wkbPolyhedralSurface) {
        for (const OGRPolygon* part : static_cast<const OGRPolyhedralSurface&>(g)) {
            std::string problem = Collect(*part, out);
            if (!problem.empty())
                return problem;
        }
        return "";
    }
    if (OGR_GT_IsSubClassOf(type, wkbGeometryCollection)) {
        for (const OGRGeometry* part : static_cast<const OGRGeometryCollection&>(g)) {
            std::string problem = Collect(*part, out);
            if (!problem.empty())
                return problem;
        }
        return "";
    }
    return FormatString("a %s, neither a triangle nor a point",
                        OGRGeometryTypeToName(g.getGeometryType()));
}

// Whether a layer's declared geometry may hold triangles or points.
bool MayHoldSurface(OGRLayer* layer) {
    const OGRwkbGeometryType type = wkbFlatten(layer->GetGeomType());
    switch (type) {
        case wkbPoint:
        case wkbMultiPoint:
        case wkbPolygon:
        case wkbMultiPolygon:
        case wkbTriangle:
        case wkbTIN:
        case wkbPolyhedralSurface:
        case wkbGeometryCollection:
        case wkbUnknown:
            return true;
        default:
            return false;
    }
}

// The triangles and points of a layer. A geometry of another kind makes the layer unusable:
// strict, that throws DataException naming it; otherwise the layer gives nothing.
SurfaceData ReadLayer(OGRLayer* layer, const std::string& path, bool strict) {
    SurfaceData data;
    layer->ResetReading();
    for (auto& feature : *layer) {
        const OGRGeometry* g = feature->GetGeometryRef();
        if (g == nullptr)
            continue;
        const std::string problem = Collect(*g, data);
        if (problem.empty())
            continue;
        if (!strict)
            return SurfaceData();
        KESTREL_THROW(
            DataException,
            FormatString("TIN %s, layer %s, feature %lld: %s", path.c_str(), layer->GetName(),
                         static_cast<long long>(feature->GetFID()), problem.c_str()));
    }
    return data;
}

std::vector<Triangle> Triangulate(const OGRMultiPoint& points, const std::string& path) {
    gdalsupport::ErrorCapture errors;
    std::unique_ptr<OGRGeometry> result(points.DelaunayTriangulation(0.0, FALSE));
    if (!result) {
        KESTREL_THROW(DataException,
                      FormatString("TIN %s: its %d points cannot be triangulated: %s", path.c_str(),
                                   points.getNumGeometries(), errors.Reason().c_str()));
    }
    SurfaceData data;
    Collect(*result, data);
    return std::move(data.triangles);
}

}  // namespace

std::unique_ptr<TinReader> OpenTinReader(const std::string& path, int layerNumber, double offset,
                                         double scale, ogc::cs::DatumType datum) {
    if (layerNumber < 0) {
        KESTREL_THROW(DataException,
                      FormatString("TIN %s: layer number %d; layers count from 1 (0: the first "
                                   "that holds triangles or points)",
                                   path.c_str(), layerNumber));
    }
    if (!std::isfinite(offset) || !std::isfinite(scale) || scale <= 0.0) {
        KESTREL_THROW(DataException,
                      FormatString("TIN %s: the height offset %g and scale %g must be finite and "
                                   "the scale greater than 0",
                                   path.c_str(), offset, scale));
    }
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    GDALDatasetUniquePtr dataset(
        GDALDataset::Open(path.c_str(), GDAL_OF_VECTOR | GDAL_OF_READONLY));
    if (!dataset)
        return nullptr;

    std::vector<OGRLayer*> candidates;
    if (layerNumber > 0) {
        if (layerNumber > dataset->GetLayerCount() ||
            !MayHoldSurface(dataset->GetLayer(layerNumber - 1)))
            return nullptr;
        candidates.push_back(dataset->GetLayer(layerNumber - 1));
    } else {
        for (int i = 0; i < dataset->GetLayerCount(); ++i) {
            if (MayHoldSurface(dataset->GetLayer(i)))
                candidates.push_back(dataset->GetLayer(i));
        }
    }
    for (OGRLayer* layer : candidates) {
        SurfaceData data = ReadLayer(layer, path, layerNumber > 0);
        std::vector<Triangle> triangles = std::move(data.triangles);
        if (triangles.empty() && data.points.getNumGeometries() >= 3)
            triangles = Triangulate(data.points, path);
        if (triangles.empty())
            continue;
        std::unique_ptr<ogc::cs::ICRS> crs;
        if (const OGRSpatialReference* srs = layer->GetSpatialRef())
            crs = std::make_unique<ogc::cs::ICRS>(*srs);
        // Heights in metres, as for a raster DEM.
        const double unitScale = scale * ogc::utils::GetVerticalReference(crs.get()).metresPerUnit;
        if (offset != 0.0 || unitScale != 1.0) {
            for (auto& t : triangles)
                for (double& z : t.z)
                    z = offset + unitScale * z;
        }
        return std::make_unique<OgrTinReader>(TriangleIndex(std::move(triangles)), std::move(crs),
                                              datum, path);
    }
    return nullptr;
}

std::size_t LargestIndexCell(const TinReader& reader) {
    const auto* ours = dynamic_cast<const OgrTinReader*>(&reader);
    return ours != nullptr ? ours->GetLargestCell() : 0;
}

}  // namespace tin
}  // namespace kestrel
