// The ortho layout: the source image's border traced through its model onto the terrain.
#include <algorithm>
#include <cmath>
#include <limits>
#include <memory>
#include <vector>

#include <ogr_spatialref.h>

#include <kestrel/dem.h>
#include <kestrel/elevation.h>
#include <kestrel/exception.h>
#include <kestrel/orthoutils.h>

#include "layoutinternal.h"

namespace kestrel {
namespace orthoutils {

namespace {

using ogc::cs::CoordinateTransformation;
using ogc::cs::ICRS;

// The largest grid side accepted: a wrong pixel size must not give an absurd raster.
constexpr double kMaxGridSide = 1048576.0;
// The least share of an image's ground that a surface must cover.
constexpr double kMinSurfaceCover = 0.02;

// The horizontal part of a coordinate system (compound: its horizontal CRS; geographic 3-D: the
// 2-D one), so that transformations between ground positions never touch heights.
std::unique_ptr<ICRS> Horizontal(const ICRS* crs) {
    if (crs == nullptr)
        return nullptr;
    std::unique_ptr<OGRSpatialReference> srs(crs->GetSpatialReference().Clone());
    if (srs->IsCompound())
        srs->StripVertical();
    if (srs->GetAxesCount() == 3)
        srs->DemoteTo2D(nullptr);
    return std::make_unique<ICRS>(*srs);
}

// Ground positions from one coordinate system to another; identity when either is unknown or
// both are the same.
class PlaneMapping {
  public:
    PlaneMapping(const ICRS* from, const ICRS* to) {
        auto a = Horizontal(from), b = Horizontal(to);
        if (a && b && !a->IsSame(*b))
            transform_ = std::make_unique<CoordinateTransformation>(*a, *b);
    }
    // Maps in place; points that fail become NaN.
    void Map(std::size_t n, double* x, double* y) const {
        if (transform_)
            transform_->Transform(n, x, y);
    }

  private:
    std::unique_ptr<CoordinateTransformation> transform_;
};

double PolygonArea(const std::vector<double>& x, const std::vector<double>& y) {
    double twice = 0.0;
    for (std::size_t i = 0, n = x.size(); i < n; ++i) {
        const std::size_t j = (i + 1) % n;
        twice += x[i] * y[j] - x[j] * y[i];
    }
    return std::fabs(twice) / 2.0;
}

// Positions on the image border, top edge left to right, right edge downwards, bottom edge right
// to left, left edge upwards: an open ring starting at the top-left corner.
void BorderPositions(unsigned int width, unsigned int height, int perEdge,
                     std::vector<double>& pixel, std::vector<double>& line) {
    const double w = width, h = height;
    for (int edge = 0; edge < 4; ++edge) {
        for (int k = 0; k < perEdge; ++k) {
            const double t = static_cast<double>(k) / perEdge;
            switch (edge) {
                case 0:
                    pixel.push_back(t * w), line.push_back(0.0);
                    break;
                case 1:
                    pixel.push_back(w), line.push_back(t * h);
                    break;
                case 2:
                    pixel.push_back((1.0 - t) * w), line.push_back(h);
                    break;
                default:
                    pixel.push_back(0.0), line.push_back((1.0 - t) * h);
                    break;
            }
        }
    }
}

// Rays through image positions, intersected with the terrain.
class RayCaster {
  public:
    RayCaster(const mathmodel::IMathModel& model, const dem::IElevationSource& terrain)
        : model_(model), terrain_(terrain), toTerrain_(model.GetCRS(), terrain.GetCRS()) {}

    // Model ground positions of image positions at heights h.
    void Ground(std::size_t n, const double* pixel, const double* line, const double* h, double* x,
                double* y) const {
        std::unique_ptr<bool[]> ok(new bool[n]);
        model_.ImageToGround(n, pixel, line, h, x, y, ok.get());
        for (std::size_t i = 0; i < n; ++i) {
            if (!ok[i])
                x[i] = y[i] = NAN;
        }
    }

    // Terrain heights below model ground positions; positions in terrain coordinates are
    // written to tx, ty.
    void Terrain(std::size_t n, const double* x, const double* y, double* tx, double* ty,
                 double* heights) const {
        std::copy(x, x + n, tx);
        std::copy(y, y + n, ty);
        toTerrain_.Map(n, tx, ty);
        terrain_.GetHeights(n, tx, ty, heights);
    }

    const PlaneMapping& ToTerrain() const { return toTerrain_; }

    // Intersects each ray from height hi down to lo with the terrain: the first point where the
    // ray reaches the surface. Ground positions (model coordinates) and heights of the hits go
    // to x, y, h; a ray without a hit gets NaN.
    void Intersect(const std::vector<double>& pixel, const std::vector<double>& line, double hi,
                   double lo, double stepLength, std::vector<double>& x, std::vector<double>& y,
                   std::vector<double>& h, int depth = 0) const {
        const std::size_t n = pixel.size();
        x.assign(n, NAN), y.assign(n, NAN), h.assign(n, NAN);
        if (n == 0)
            return;
        // The march follows each ray through a few exact nodes, linearly in between: a ray
        // bends little over the height range, and the bracket it finds is refined exactly.
        constexpr int kNodes = 9;
        std::vector<double> nodeX(kNodes * n), nodeY(kNodes * n);
        {
            std::vector<double> level(n), gx(n), gy(n);
            for (int k = 0; k < kNodes; ++k) {
                std::fill(level.begin(), level.end(), hi - (hi - lo) * k / (kNodes - 1));
                Ground(n, pixel.data(), line.data(), level.data(), gx.data(), gy.data());
                toTerrain_.Map(n, gx.data(), gy.data());
                std::copy(gx.begin(), gx.end(), nodeX.begin() + k * n);
                std::copy(gy.begin(), gy.end(), nodeY.begin() + k * n);
            }
        }
        // Steps per ray: its horizontal run over the step length.
        std::vector<int> steps(n, 1);
        for (std::size_t i = 0; i < n; ++i) {
            double run = 0.0;
            for (int k = 1; k < kNodes; ++k) {
                run += std::hypot(nodeX[k * n + i] - nodeX[(k - 1) * n + i],
                                  nodeY[k * n + i] - nodeY[(k - 1) * n + i]);
            }
            if (std::isfinite(run))
                steps[i] = static_cast<int>(std::min(8192.0, std::ceil(run / stepLength))) + 1;
        }
        // March down the rays in lockstep, keeping the last height above the terrain ("upper")
        // and the first one at or below it ("lower").
        std::vector<double> upper(n, NAN), lower(n, NAN);
        std::vector<std::size_t> active(n), startsBelow;
        for (std::size_t i = 0; i < n; ++i)
            active[i] = i;
        std::vector<double> ax, ay, ah, at;
        for (int step = 0; !active.empty(); ++step) {
            const std::size_t m = active.size();
            ax.resize(m), ay.resize(m), ah.resize(m), at.resize(m);
            for (std::size_t k = 0; k < m; ++k) {
                const std::size_t i = active[k];
                const double t = static_cast<double>(step) / steps[i];
                const double node = std::min(t * (kNodes - 1), kNodes - 1.0 - 1e-12);
                const int segment = static_cast<int>(node);
                const double f = node - segment;
                const std::size_t a = segment * n + i, b = (segment + 1) * n + i;
                ax[k] = nodeX[a] + f * (nodeX[b] - nodeX[a]);
                ay[k] = nodeY[a] + f * (nodeY[b] - nodeY[a]);
                ah[k] = hi - (hi - lo) * t;
            }
            terrain_.GetHeights(m, ax.data(), ay.data(), at.data());
            std::size_t kept = 0;
            for (std::size_t k = 0; k < m; ++k) {
                const std::size_t i = active[k];
                if (std::isnan(at[k])) {
                    // No terrain here (outside the DEM, or no-data): march on.
                } else if (ah[k] > at[k]) {
                    upper[i] = ah[k];
                } else if (std::isnan(upper[i]) && step == 0) {
                    // The ray starts below the surface: a peak the height survey missed.
                    startsBelow.push_back(i);
                    continue;
                } else {
                    lower[i] = ah[k];
                    if (std::isnan(upper[i]))
                        upper[i] = ah[k];
                    continue;
                }
                if (step < steps[i])
                    active[kept++] = i;
            }
            active.resize(kept);
        }
        Bisect(pixel, line, upper, lower, x, y, h);
        // Rays that start below the surface are cast again from higher up.
        if (!startsBelow.empty() && depth < 4) {
            std::vector<double> sp, sl, sx, sy, sh;
            for (std::size_t i : startsBelow)
                sp.push_back(pixel[i]), sl.push_back(line[i]);
            const double span = hi - lo;
            Intersect(sp, sl, hi + 2 * span, hi, stepLength, sx, sy, sh, depth + 1);
            for (std::size_t k = 0; k < startsBelow.size(); ++k) {
                const std::size_t i = startsBelow[k];
                x[i] = sx[k], y[i] = sy[k], h[i] = sh[k];
            }
        }
    }

  private:
    // Narrows each bracket [lower, upper] of a ray's height to a millimetre on the exact ray,
    // then places the ray's hit at its lower end.
    void Bisect(const std::vector<double>& pixel, const std::vector<double>& line,
                std::vector<double>& upper, std::vector<double>& lower, std::vector<double>& x,
                std::vector<double>& y, std::vector<double>& h) const {
        std::vector<std::size_t> rays;
        for (std::size_t i = 0; i < pixel.size(); ++i) {
            if (!std::isnan(lower[i]))
                rays.push_back(i);
        }
        const std::size_t m = rays.size();
        std::vector<double> bp(m), bl(m), bh(m), bx(m), by(m), tx(m), ty(m), th(m);
        for (std::size_t k = 0; k < m; ++k)
            bp[k] = pixel[rays[k]], bl[k] = line[rays[k]];
        double width = 0.0;
        for (std::size_t i : rays)
            width = std::max(width, upper[i] - lower[i]);
        for (; width > 1e-3; width /= 2) {
            for (std::size_t k = 0; k < m; ++k)
                bh[k] = (upper[rays[k]] + lower[rays[k]]) / 2;
            Ground(m, bp.data(), bl.data(), bh.data(), bx.data(), by.data());
            Terrain(m, bx.data(), by.data(), tx.data(), ty.data(), th.data());
            for (std::size_t k = 0; k < m; ++k) {
                const std::size_t i = rays[k];
                if (bh[k] <= th[k])
                    lower[i] = bh[k];
                else
                    upper[i] = bh[k];
            }
        }
        for (std::size_t k = 0; k < m; ++k)
            bh[k] = lower[rays[k]];
        Ground(m, bp.data(), bl.data(), bh.data(), bx.data(), by.data());
        for (std::size_t k = 0; k < m; ++k) {
            const std::size_t i = rays[k];
            x[i] = bx[k], y[i] = by[k], h[i] = bh[k];
        }
    }

    const mathmodel::IMathModel& model_;
    const dem::IElevationSource& terrain_;
    PlaneMapping toTerrain_;
};

// The terrain heights below a 3 x 3 grid of image positions, found by projecting each at the
// height found below it until that settles; false when none has a height.
bool ReferenceHeights(const RayCaster& caster, unsigned int width, unsigned int height,
                      double start, double& low, double& high) {
    std::vector<double> pixel, line;
    for (int j = 0; j < 3; ++j) {
        for (int i = 0; i < 3; ++i)
            pixel.push_back(width * (0.05 + 0.45 * i)), line.push_back(height * (0.05 + 0.45 * j));
    }
    const std::size_t n = pixel.size();
    std::vector<double> level(n, start), x(n), y(n), tx(n), ty(n), found(n);
    for (int iteration = 0; iteration < 8; ++iteration) {
        caster.Ground(n, pixel.data(), line.data(), level.data(), x.data(), y.data());
        caster.Terrain(n, x.data(), y.data(), tx.data(), ty.data(), found.data());
        for (std::size_t i = 0; i < n; ++i) {
            if (std::isfinite(found[i]))
                level[i] = found[i];
        }
    }
    low = HUGE_VAL, high = -HUGE_VAL;
    for (std::size_t i = 0; i < n; ++i) {
        if (std::isfinite(found[i]))
            low = std::min(low, found[i]), high = std::max(high, found[i]);
    }
    return low <= high;
}

// The lowest and highest terrain heights on a grid of samples over a box in terrain
// coordinates; false when no sample has a height.
bool SurveyHeights(const dem::IElevationSource& terrain, double minX, double minY, double maxX,
                   double maxY, int side, double& low, double& high, double& median) {
    std::vector<double> x, y;
    for (int j = 0; j < side; ++j) {
        for (int i = 0; i < side; ++i) {
            x.push_back(minX + (maxX - minX) * (i + 0.5) / side);
            y.push_back(minY + (maxY - minY) * (j + 0.5) / side);
        }
    }
    std::vector<double> heights(x.size());
    terrain.GetHeights(x.size(), x.data(), y.data(), heights.data());
    heights.erase(
        std::remove_if(heights.begin(), heights.end(), [](double v) { return !std::isfinite(v); }),
        heights.end());
    if (heights.empty())
        return false;
    const auto range = std::minmax_element(heights.begin(), heights.end());
    low = *range.first;
    high = *range.second;
    std::nth_element(heights.begin(), heights.begin() + heights.size() / 2, heights.end());
    median = heights[heights.size() / 2];
    return true;
}

// Bounding box of model ground positions in terrain coordinates, enlarged by a margin.
bool TerrainBox(const PlaneMapping& toTerrain, std::vector<double> x, std::vector<double> y,
                double margin, double box[4]) {
    toTerrain.Map(x.size(), x.data(), y.data());
    box[0] = box[1] = std::numeric_limits<double>::infinity();
    box[2] = box[3] = -std::numeric_limits<double>::infinity();
    for (std::size_t i = 0; i < x.size(); ++i) {
        if (!std::isfinite(x[i]) || !std::isfinite(y[i]))
            continue;
        box[0] = std::min(box[0], x[i]), box[1] = std::min(box[1], y[i]);
        box[2] = std::max(box[2], x[i]), box[3] = std::max(box[3], y[i]);
    }
    if (!(box[0] <= box[2] && box[1] <= box[3]))
        return false;
    const double dx = (box[2] - box[0]) * margin, dy = (box[3] - box[1]) * margin;
    box[0] -= dx, box[1] -= dy, box[2] += dx, box[3] += dy;
    return true;
}

// The part of a ring inside a box (minX, minY, maxX, maxY), by clipping it against each side.
void ClipRing(std::vector<double>& x, std::vector<double>& y, const double box[4]) {
    for (int side = 0; side < 4 && !x.empty(); ++side) {
        const bool horizontal = side % 2 == 0;  // sides 0 and 2 bound x, 1 and 3 bound y
        const double limit = box[side];
        auto inside = [&](double px, double py) {
            const double v = horizontal ? px : py;
            return side < 2 ? v >= limit : v <= limit;
        };
        std::vector<double> cx, cy;
        for (std::size_t i = 0, n = x.size(); i < n; ++i) {
            const std::size_t j = (i + 1) % n;
            const bool a = inside(x[i], y[i]), b = inside(x[j], y[j]);
            if (a)
                cx.push_back(x[i]), cy.push_back(y[i]);
            if (a != b) {
                const double t = horizontal ? (limit - x[i]) / (x[j] - x[i])
                                            : (limit - y[i]) / (y[j] - y[i]);
                cx.push_back(x[i] + t * (x[j] - x[i])), cy.push_back(y[i] + t * (y[j] - y[i]));
            }
        }
        x.swap(cx), y.swap(cy);
    }
}

std::unique_ptr<ICRS> UtmZoneOf(double longitude, double latitude) {
    int zone = static_cast<int>(std::floor((longitude + 180.0) / 6.0)) % 60 + 1;
    if (zone < 1)
        zone += 60;
    const int code = (latitude >= 0 ? 32600 : 32700) + zone;
    return std::make_unique<ICRS>("EPSG:" + std::to_string(code));
}

void CheckFinite(const std::vector<double>& values, const char* what, const SourceLocation& at) {
    for (double v : values) {
        if (!std::isfinite(v))
            KESTREL_THROW_AT(at, DataException, FormatString("%s holds a non-finite value", what));
    }
}

// A surface that covers part of the image: the border rays that miss it are placed at the
// mean height (flat), and the ring is cut to the surface's extent, so that the layout is that of
// the ground the surface covers. Refused when what remains is under kMinSurfaceCover of the
// image's ground.
void ClipToTerrain(const mathmodel::IMathModel& model, const dem::IElevationSource& terrain,
                   const std::vector<double>& flatX, const std::vector<double>& flatY,
                   double firstPixel, double firstLine, std::vector<double>& gx,
                   std::vector<double>& gy, Layout& layout) {
    for (std::size_t i = 0; i < gx.size(); ++i) {
        if (!std::isfinite(gx[i]) || !std::isfinite(gy[i]))
            gx[i] = flatX[i], gy[i] = flatY[i];
    }
    std::vector<double> tx = gx, ty = gy;
    PlaneMapping(model.GetCRS(), terrain.GetCRS()).Map(tx.size(), tx.data(), ty.data());
    const double whole = PolygonArea(tx, ty);
    double box[4];
    terrain.GetExtent(box[0], box[1], box[2], box[3]);
    ClipRing(tx, ty, box);
    const double covered = tx.size() >= 3 ? PolygonArea(tx, ty) : 0.0;
    const double share = whole > 0 ? covered / whole : 0.0;
    if (share == 0.0) {
        KESTREL_THROW(DataException,
                      "The border rays of the image miss the DEM entirely: the surface and the "
                      "image's ground do not overlap");
    }
    if (share < kMinSurfaceCover) {
        KESTREL_THROW(DataException,
                      FormatString("The DEM covers %.1f %% of the scene's ground, under the "
                                   "%.0f %% needed (the border ray at pixel %g, line %g misses "
                                   "it)",
                                   100.0 * share, 100.0 * kMinSurfaceCover, firstPixel,
                                   firstLine));
    }
    PlaneMapping(terrain.GetCRS(), model.GetCRS()).Map(tx.size(), tx.data(), ty.data());
    gx.swap(tx), gy.swap(ty);
    layout.uncoveredShare = 1.0 - share;
}

}  // namespace

Layout ComputeLayout(const mathmodel::IMathModel& model, const dem::IElevationSource* terrain,
                     const LayoutRequest& request) {
    const unsigned int width = model.GetImageWidth(), height = model.GetImageHeight();
    if (width == 0 || height == 0) {
        KESTREL_THROW(
            DataException,
            FormatString("The math model's image is empty (%u x %u pixels)", width, height));
    }
    if (!std::isfinite(request.pixelWidth) || !std::isfinite(request.pixelHeight) ||
        request.pixelWidth < 0 || request.pixelHeight < 0) {
        KESTREL_THROW(DataException,
                      FormatString("The pixel size (%g, %g) is not a finite value of 0 or more",
                                   request.pixelWidth, request.pixelHeight));
    }
    if (!std::isfinite(request.flatHeight)) {
        KESTREL_THROW(DataException,
                      FormatString("The flat terrain height %g is not finite", request.flatHeight));
    }
    const int perEdge =
        request.borderSamples > 0
            ? request.borderSamples
            : static_cast<int>(std::clamp(std::max(width, height) / 16u, 64u, 512u));
    std::vector<double> pixel, line;
    BorderPositions(width, height, perEdge, pixel, line);
    const std::size_t n = pixel.size();

    Layout layout;
    std::vector<double> gx(n), gy(n), gh(n, request.flatHeight);
    // Does the ground position depend on the height at all (not for a geotransform or GCPs)?
    // Asked at the centre and at the corners: a nadir camera's centre ray may be plumb.
    bool heightMatters = false;
    {
        const double w = width, h = height;
        const double at[5][2] = {{w / 2, h / 2}, {0, 0}, {w, 0}, {0, h}, {w, h}};
        double cp[10], cl[10], ch[10], cx[10], cy[10];
        bool ok[10];
        for (int k = 0; k < 10; ++k) {
            cp[k] = at[k / 2][0], cl[k] = at[k / 2][1];
            ch[k] = request.flatHeight + (k % 2 == 0 ? 0.0 : 100.0);
        }
        model.ImageToGround(10, cp, cl, ch, cx, cy, ok);
        if (!ok[0] || !ok[1]) {
            KESTREL_THROW(DataException,
                          "The math model cannot place the image centre on the ground");
        }
        for (int k = 0; k < 10; k += 2)
            heightMatters = heightMatters || (ok[k] && ok[k + 1] &&
                                              std::hypot(cx[k + 1] - cx[k], cy[k + 1] - cy[k]) > 0.0);
    }
    if (terrain == nullptr || !heightMatters) {
        std::unique_ptr<bool[]> ok(new bool[n]);
        model.ImageToGround(n, pixel.data(), line.data(), gh.data(), gx.data(), gy.data(),
                            ok.get());
        for (std::size_t i = 0; i < n; ++i) {
            if (!ok[i]) {
                KESTREL_THROW(DataException,
                              FormatString("The math model cannot place image position (%g, %g) "
                                           "on the ground",
                                           pixel[i], line[i]));
            }
        }
        layout.minHeight = layout.maxHeight = request.flatHeight;
        if (terrain != nullptr) {
            std::vector<double> tx = gx, ty = gy, th(n);
            RayCaster(model, *terrain)
                .Terrain(n, gx.data(), gy.data(), tx.data(), ty.data(), th.data());
            th.erase(std::remove_if(th.begin(), th.end(), [](double v) { return std::isnan(v); }),
                     th.end());
            if (!th.empty()) {
                const auto range = std::minmax_element(th.begin(), th.end());
                layout.minHeight = *range.first, layout.maxHeight = *range.second;
            }
        }
    } else {
        const ogc::cs::DatumType modelDatum = ogc::utils::GetVerticalDatumType(model.GetCRS());
        const ogc::cs::DatumType terrainDatum = terrain->GetOutputVerticalDatum();
        if (terrainDatum != ogc::cs::DatumMathModel && terrainDatum != modelDatum) {
            KESTREL_THROW(
                DataException,
                FormatString("The DEM delivers heights in datum %d, the math model "
                             "takes them in datum %d: set the DEM's output datum to "
                             "the model's",
                             static_cast<int>(terrainDatum), static_cast<int>(modelDatum)));
        }
        const RayCaster caster(model, *terrain);
        // Survey the terrain's heights where the scene lies: from the heights below a few
        // image positions, then over the border projected at the heights found, twice.
        double box[4], low, high;
        if (!ReferenceHeights(caster, width, height, request.flatHeight, low, high)) {
            double median;
            terrain->GetExtent(box[0], box[1], box[2], box[3]);
            if (!SurveyHeights(*terrain, box[0], box[1], box[2], box[3], 64, low, high, median))
                KESTREL_THROW(DataException, "The DEM has no height anywhere");
            low = high = median;
        }
        for (int pass = 0; pass < 2; ++pass) {
            std::vector<double> bx, by;
            for (double level : {low, high}) {
                std::vector<double> hx(n), hy(n), hh(n, level);
                caster.Ground(n, pixel.data(), line.data(), hh.data(), hx.data(), hy.data());
                bx.insert(bx.end(), hx.begin(), hx.end());
                by.insert(by.end(), hy.begin(), hy.end());
            }
            double l2, h2, m2;
            if (!TerrainBox(caster.ToTerrain(), bx, by, 0.1, box) ||
                !SurveyHeights(*terrain, box[0], box[1], box[2], box[3], 256, l2, h2, m2)) {
                KESTREL_THROW(DataException,
                              "The border rays of the image miss the DEM entirely: it has no "
                              "height where the scene lies");
            }
            low = l2, high = h2;
        }
        const double span = high - low;
        const double hi = high + 0.1 * span + 1.0, lo = low - 0.1 * span - 1.0;
        // One step of the march: the source's ground resolution, in terrain units.
        std::vector<double> fx(n), fy(n), fh(n, (low + high) / 2), ftx, fty;
        caster.Ground(n, pixel.data(), line.data(), fh.data(), fx.data(), fy.data());
        ftx = fx, fty = fy;
        caster.ToTerrain().Map(n, ftx.data(), fty.data());
        const double area = PolygonArea(ftx, fty);
        double stepLength = std::sqrt(area / (static_cast<double>(width) * height));
        if (!(stepLength > 0) || !std::isfinite(stepLength))
            KESTREL_THROW(DataException, "The math model gives the image no area on the ground");
        // Between the posts of a raster DEM the surface is bilinear: half a post is fine enough.
        if (const auto* raster = dynamic_cast<const dem::IRasterDEM*>(terrain)) {
            const ogc::cs::GeocodingInfo* posts = raster->GetGeocoding();
            if (posts != nullptr) {
                stepLength = std::max(
                    stepLength, std::min(posts->GetPixelWidth(), posts->GetPixelHeight()) / 2);
            }
        }
        caster.Intersect(pixel, line, hi, lo, stepLength, gx, gy, gh);
        std::size_t missed = 0, first = n;
        for (std::size_t i = 0; i < n; ++i) {
            if (std::isnan(gh[i])) {
                ++missed;
                first = std::min(first, i);
            }
        }
        // Heights of the rays' hits; of the surveyed terrain when every ray misses (a surface
        // inside the image's border).
        double hitLow = HUGE_VAL, hitHigh = -HUGE_VAL;
        for (double v : gh) {
            if (std::isfinite(v))
                hitLow = std::min(hitLow, v), hitHigh = std::max(hitHigh, v);
        }
        layout.minHeight = missed == n ? low : hitLow;
        layout.maxHeight = missed == n ? high : hitHigh;
        if (missed > 0)
            ClipToTerrain(model, *terrain, fx, fy, pixel[first], line[first], gx, gy, layout);
    }

    // The output coordinate system.
    if (request.outputCRS != nullptr) {
        layout.crs = Horizontal(request.outputCRS);
    } else if (model.GetCRS() != nullptr && model.GetCRS()->IsProjected()) {
        layout.crs = Horizontal(model.GetCRS());
    } else if (model.GetCRS() != nullptr) {
        const ICRS wgs84("EPSG:4326");
        double lon = 0, lat = 0;
        for (std::size_t i = 0; i < gx.size(); ++i)
            lon += gx[i] / gx.size(), lat += gy[i] / gy.size();
        PlaneMapping(model.GetCRS(), &wgs84).Map(1, &lon, &lat);
        if (!std::isfinite(lon) || !std::isfinite(lat))
            KESTREL_THROW(DataException, "The scene's centre has no longitude and latitude");
        layout.crs = UtmZoneOf(lon, lat);
    }
    PlaneMapping(model.GetCRS(), layout.crs.get()).Map(gx.size(), gx.data(), gy.data());
    CheckFinite(gx, "The border traced in the output coordinate system", KESTREL_HERE);
    CheckFinite(gy, "The border traced in the output coordinate system", KESTREL_HERE);

    // Pixel size and grid.
    double pw = request.pixelWidth, ph = request.pixelHeight;
    if (pw == 0 && ph == 0) {
        // The ground that the surface covers holds its share of the image's pixels.
        pw = ph = std::sqrt(PolygonArea(gx, gy) / (static_cast<double>(width) * height *
                                                   (1.0 - layout.uncoveredShare)));
        if (!(pw > 0) || !std::isfinite(pw)) {
            KESTREL_THROW(DataException,
                          "The pixel size is 0 and the math model gives no ground resolution");
        }
    } else if (pw == 0) {
        pw = ph;
    } else if (ph == 0) {
        ph = pw;
    }
    const auto xs = std::minmax_element(gx.begin(), gx.end());
    const auto ys = std::minmax_element(gy.begin(), gy.end());
    double left = *xs.first, top = *ys.second;
    if (request.alignToPixelSize) {
        left = std::floor(left / pw) * pw;
        top = std::ceil(top / ph) * ph;
    }
    const double columns = std::ceil((*xs.second - left) / pw - 1e-6);
    const double rows = std::ceil((top - *ys.first) / ph - 1e-6);
    if (!(columns >= 1 && rows >= 1 && columns <= kMaxGridSide && rows <= kMaxGridSide)) {
        KESTREL_THROW(DataException,
                      FormatString("The output grid of %.0f x %.0f pixels of %g x %g is empty "
                                   "or larger than %.0f pixels a side",
                                   columns, rows, pw, ph, kMaxGridSide));
    }
    layout.geocoding = ogc::cs::GeocodingInfo::NorthUp(left, top, pw, ph);
    layout.pixels = static_cast<unsigned int>(columns);
    layout.lines = static_cast<unsigned int>(rows);
    layout.pixelWidth = pw;
    layout.pixelHeight = ph;
    layout.borderX = std::move(gx);
    layout.borderY = std::move(gy);
    return layout;
}

}  // namespace orthoutils
}  // namespace kestrel
