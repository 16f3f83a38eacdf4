// The scene footprint: the traced border clipped to the output grid and thinned.
#include <cmath>
#include <vector>

#include <kestrel/exception.h>

#include "layoutinternal.h"

namespace kestrel {
namespace orthoutils {

namespace {

struct Point {
    double x;
    double y;
};

// Clips a ring to one side of an axis-parallel line (Sutherland-Hodgman): keeps the points
// whose coordinate `axis` is >= limit (sign +1) or <= limit (sign -1).
std::vector<Point> ClipSide(const std::vector<Point>& ring, int axis, double limit, double sign) {
    std::vector<Point> out;
    const std::size_t n = ring.size();
    auto inside = [&](const Point& p) { return sign * ((axis == 0 ? p.x : p.y) - limit) >= 0; };
    for (std::size_t i = 0; i < n; ++i) {
        const Point& a = ring[i];
        const Point& b = ring[(i + 1) % n];
        const bool ina = inside(a), inb = inside(b);
        if (ina)
            out.push_back(a);
        if (ina != inb) {
            const double va = axis == 0 ? a.x : a.y, vb = axis == 0 ? b.x : b.y;
            const double t = (limit - va) / (vb - va);
            Point p{a.x + t * (b.x - a.x), a.y + t * (b.y - a.y)};
            (axis == 0 ? p.x : p.y) = limit;
            out.push_back(p);
        }
    }
    return out;
}

// Distance of p from the line through a and b (from a when they coincide).
double DistanceFromLine(const Point& p, const Point& a, const Point& b) {
    const double dx = b.x - a.x, dy = b.y - a.y;
    const double length = std::hypot(dx, dy);
    if (length == 0.0)
        return std::hypot(p.x - a.x, p.y - a.y);
    return std::fabs(dx * (p.y - a.y) - dy * (p.x - a.x)) / length;
}

// Drops the vertices that lie within tolerance of the line through their neighbours, until
// none does.
std::vector<Point> Thin(std::vector<Point> ring, double tolerance) {
    bool changed = true;
    while (changed && ring.size() > 3) {
        changed = false;
        std::vector<Point> kept;
        const std::size_t n = ring.size();
        for (std::size_t i = 0; i < n; ++i) {
            const Point& previous = kept.empty() ? ring[n - 1] : kept.back();
            const Point& next = ring[(i + 1) % n];
            if (DistanceFromLine(ring[i], previous, next) < tolerance && n - (i - kept.size()) > 3)
                changed = true;
            else
                kept.push_back(ring[i]);
        }
        ring.swap(kept);
    }
    return ring;
}

double Area(const std::vector<Point>& ring) {
    double twice = 0.0;
    for (std::size_t i = 0, n = ring.size(); i < n; ++i) {
        const Point& a = ring[i];
        const Point& b = ring[(i + 1) % n];
        twice += a.x * b.y - b.x * a.y;
    }
    return twice / 2.0;
}

}  // namespace

std::vector<GDBVertex> SceneFootprint(const ogc::cs::GeocodingInfo& geocoding, unsigned int pixels,
                                      unsigned int lines, const std::vector<double>& borderX,
                                      const std::vector<double>& borderY) {
    if (borderX.size() != borderY.size()) {
        KESTREL_THROW(DataException,
                      FormatString("The border lists differ in length (%zu x, %zu y)",
                                   borderX.size(), borderY.size()));
    }
    std::vector<Point> ring;
    for (std::size_t i = 0; i < borderX.size(); ++i) {
        if (!std::isfinite(borderX[i]) || !std::isfinite(borderY[i])) {
            KESTREL_THROW(DataException, FormatString("Border vertex %zu (%g, %g) is not finite", i,
                                                      borderX[i], borderY[i]));
        }
        Point p{};
        geocoding.GroundToPixel(borderX[i], borderY[i], p.x, p.y);
        ring.push_back(p);
    }
    ring = ClipSide(ring, 0, 0.0, 1.0);
    ring = ClipSide(ring, 0, static_cast<double>(pixels), -1.0);
    ring = ClipSide(ring, 1, 0.0, 1.0);
    ring = ClipSide(ring, 1, static_cast<double>(lines), -1.0);
    ring = Thin(std::move(ring), 0.1);
    if (ring.size() < 3 || std::fabs(Area(ring)) < 1e-6) {
        KESTREL_THROW(DataException,
                      FormatString("The scene's outline of %zu vertices has no area inside the "
                                   "output grid of %u x %u pixels",
                                   borderX.size(), pixels, lines));
    }
    std::vector<GDBVertex> vertices;
    vertices.reserve(ring.size() + 1);
    for (const Point& p : ring) {
        GDBVertex v{0.0, 0.0, 0.0};
        geocoding.PixelToGround(p.x, p.y, v.x, v.y);
        vertices.push_back(v);
    }
    vertices.push_back(vertices.front());
    return vertices;
}

}  // namespace orthoutils
}  // namespace kestrel
