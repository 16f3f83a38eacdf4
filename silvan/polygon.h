// The footprint polygon: an owned array of ground points with its bounding box.
#pragma once

#include <algorithm>
#include <cstdint>
#include <limits>
#include <utility>

#include <kestrel/exception.h>

// A point of the plane: x, then y.
template <typename T>
struct point2_t {
    T x;
    T y;
};

namespace kestrel {
namespace tin {

// An axis-aligned box: min holds the smallest x and y, max the largest. A new box is all zeros.
template <typename T, typename P>
class BBox {
  public:
    BBox() : min{T(0), T(0)}, max{T(0), T(0)} {}
    BBox(const BBox&) = default;
    BBox& operator=(const BBox&) = default;
    virtual ~BBox() = default;

    P min;
    P max;
};

// A polygon of points in the order given. The ring is stored as it is: nothing closes it or tests
// whether the last point repeats the first.
template <typename T>
class Polygon {
  public:
    // Takes over `points`, an array made with new[] holding `numPoints` points, computes the box
    // and removes consecutive duplicates. A null array is accepted only with a count of 0.
    Polygon(point2_t<T>* points_, unsigned int numPoints_)
        : ownsPoints(true), reserved(0), points(points_), numPoints(numPoints_) {
        if (points == nullptr && numPoints != 0) {
            numPoints = 0;
            KESTREL_THROW(
                DataException,
                FormatString("A polygon of %u points was given no point array", numPoints_));
        }
        ComputeBounds();
        RemoveConsecutiveDuplicates();
    }

    // A copy with its own point array; the box is copied, not recomputed.
    Polygon(const Polygon& other)
        : ownsPoints(true),
          bbox(other.bbox),
          reserved(other.reserved),
          points(nullptr),
          numPoints(other.numPoints) {
        if (numPoints != 0) {
            points = new point2_t<T>[numPoints];
            std::copy(other.points, other.points + numPoints, points);
        }
    }

    Polygon& operator=(const Polygon& other) {
        Polygon copy(other);
        Swap(copy);
        return *this;
    }

    ~Polygon() {
        if (ownsPoints && points != nullptr)
            delete[] points;
    }

    // Recomputes the box from the points. Without points the box is inverted: min holds the
    // largest finite value and max its negative. (min and max are parenthesised so that the
    // macros of <windows.h> cannot expand in a caller that includes it first.)
    void ComputeBounds() {
        const T big = (std::numeric_limits<T>::max)();
        point2_t<T> lo{big, big};
        point2_t<T> hi{-big, -big};
        for (unsigned int i = 0; i < numPoints; ++i) {
            lo.x = (std::min)(lo.x, points[i].x);
            lo.y = (std::min)(lo.y, points[i].y);
            hi.x = (std::max)(hi.x, points[i].x);
            hi.y = (std::max)(hi.y, points[i].y);
        }
        bbox.min = lo;
        bbox.max = hi;
    }

    // Drops each point that lies within 1e-9 of its predecessor in x and in y, the predecessor
    // being taken before any removal, so a creeping run collapses to its first point. The first
    // point always stays; the last is not compared with the first. The kept points move to the
    // front of the same array; the box is left as it was.
    void RemoveConsecutiveDuplicates() {
        if (points == nullptr || numPoints == 0)
            return;
        const T tolerance = T(1e-9);
        point2_t<T> previous = points[0];
        unsigned int kept = 1;
        for (unsigned int i = 1; i < numPoints; ++i) {
            const point2_t<T> current = points[i];
            const T dx = current.x - previous.x;
            const T dy = current.y - previous.y;
            const bool duplicate =
                dx > -tolerance && dx < tolerance && dy > -tolerance && dy < tolerance;
            if (!duplicate)
                points[kept++] = current;
            previous = current;
        }
        numPoints = kept;
    }

    bool ownsPoints;
    BBox<T, point2_t<T>> bbox;
    // Carried along by copies; this library gives it no meaning.
    std::int32_t reserved;
    point2_t<T>* points;
    unsigned int numPoints;

  private:
    void Swap(Polygon& other) noexcept {
        std::swap(ownsPoints, other.ownsPoints);
        std::swap(bbox, other.bbox);
        std::swap(reserved, other.reserved);
        std::swap(points, other.points);
        std::swap(numPoints, other.numPoints);
    }
};

}  // namespace tin
}  // namespace kestrel
