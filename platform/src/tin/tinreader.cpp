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
#include "../gdalsupport.h"

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

// Triangles in a grid of cells over their bounding box, each cell listing the triangles whose
// bounding box meets it.
class TriangleIndex {
  public:
    explicit TriangleIndex(std::vector<Triangle> triangles) : triangles_(std::move(triangles)) {
        minX_ = minY_ = std::numeric_limits<double>::infinity();
        maxX_ = maxY_ = -minX_;
        for (const auto& t : triangles_) {
            for (int k = 0; k < 3; ++k) {
                minX_ = std::min(minX_, t.x[k]), maxX_ = std::max(maxX_, t.x[k]);
                minY_ = std::min(minY_, t.y[k]), maxY_ = std::max(maxY_, t.y[k]);
            }
        }
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
        ForEachCell([&](std::size_t t, std::size_t cell) {
            members_[counts[cell]++] = static_cast<std::uint32_t>(t);
        });
    }

    // The height at (x, y), NaN outside every triangle.
    double HeightAt(double x, double y) const {
        if (!(x >= minX_ && x <= maxX_ && y >= minY_ && y <= maxY_))
            return NAN;
        const std::size_t cx =
            std::min(columns_ - 1, static_cast<std::size_t>((x - minX_) / cellW_));
        const std::size_t cy = std::min(rows_ - 1, static_cast<std::size_t>((y - minY_) / cellH_));
        const std::size_t cell = cy * columns_ + cx;
        for (std::size_t k = start_[cell]; k < start_[cell + 1]; ++k) {
            double z;
            if (Interpolate(triangles_[members_[k]], x, y, z))
                return z;
        }
        return NAN;
    }

    std::size_t Count() const { return triangles_.size(); }
    void Extent(double& minX, double& minY, double& maxX, double& maxY) const {
        minX = minX_, minY = minY_, maxX = maxX_, maxY = maxY_;
    }

  private:
    template <class F>
    void ForEachCell(F&& f) const {
        for (std::size_t t = 0; t < triangles_.size(); ++t) {
            const Triangle& tri = triangles_[t];
            const auto [x0, x1] = std::minmax({tri.x[0], tri.x[1], tri.x[2]});
            const auto [y0, y1] = std::minmax({tri.y[0], tri.y[1], tri.y[2]});
            const std::size_t cx0 = Column(x0), cx1 = Column(x1);
            const std::size_t cy0 = Row(y0), cy1 = Row(y1);
            for (std::size_t cy = cy0; cy <= cy1; ++cy)
                for (std::size_t cx = cx0; cx <= cx1; ++cx)
                    f(t, cy * columns_ + cx);
        }
    }
    std::size_t Column(double x) const {
        return std::min(columns_ - 1,
                        static_cast<std::size_t>(std::max(0.0, (x - minX_) / cellW_)));
    }
    std::size_t Row(double y) const {
        return std::min(rows_ - 1, static_cast<std::size_t>(std::max(0.0, (y - minY_) / cellH_)));
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
    double minX_, minY_, maxX_, maxY_;
    std::size_t columns_ = 1, rows_ = 1;
    double cellW_ = 1, cellH_ = 1;
    std::vector<std::size_t> start_;
    std::vector<std::uint32_t> members_;
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

}  // namespace tin
}  // namespace kestrel
