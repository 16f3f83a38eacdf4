// The footprint polygon: bounds, removal of near-duplicate points, copies.
#include <silvan/polygon.h>

#include "support.h"

#include <array>
#include <limits>
#include <memory>
#include <utility>
#include <vector>

using kestrel::tin::Polygon;
using P = point2_t<double>;
using Pts = std::vector<std::pair<double, double>>;

namespace {

// A polygon made the way the readers make one: from a new[] array that it takes over.
Polygon<double> Make(const Pts& points) {
    P* array = new P[points.size()];
    for (std::size_t i = 0; i < points.size(); ++i)
        array[i] = {points[i].first, points[i].second};
    return Polygon<double>(array, static_cast<unsigned int>(points.size()));
}

Pts PointsOf(const Polygon<double>& polygon) {
    Pts out;
    for (unsigned int i = 0; i < polygon.numPoints; ++i)
        out.emplace_back(polygon.points[i].x, polygon.points[i].y);
    return out;
}

std::array<double, 4> Box(const Polygon<double>& p) {
    return {p.bbox.min.x, p.bbox.min.y, p.bbox.max.x, p.bbox.max.y};
}

}  // namespace

TEST(Polygon, BoxSpansEachAxisAndIsComputedBeforeDuplicatesGo) {
    EXPECT_EQ(Box(Make({{3, -1}, {-2, 5}, {0.5, 7}})), (std::array<double, 4>{-2, -1, 3, 7}));
    const Polygon<double> cleaned = Make({{0, 0}, {5e-10, 5e-10}});
    EXPECT_EQ(PointsOf(cleaned), (Pts{{0, 0}}));
    EXPECT_EQ(Box(cleaned), (std::array<double, 4>{0, 0, 5e-10, 5e-10}));
}

TEST(Polygon, PointWithinOneNanometreOfItsOriginalPredecessorIsDropped) {
    const std::pair<Pts, Pts> cases[] = {
        {{{1, 1}, {1, 1}, {2, 2}}, {{1, 1}, {2, 2}}},
        {{{0, 0}, {1e-9, 0}}, {{0, 0}, {1e-9, 0}}},  // the tolerance is strict
        {{{0, 0}, {5e-10, 0}, {1, 1}}, {{0, 0}, {1, 1}}},
        {{{0, 0}, {0, 1}}, {{0, 0}, {0, 1}}},  // close in x only
        {{{1, 1}, {1 - 5e-10, 1 - 5e-10}}, {{1, 1}}},
        // Each point is compared with its predecessor as given, not with the last one kept.
        {{{0, 0}, {4e-10, 0}, {8e-10, 0}, {1.2e-9, 0}}, {{0, 0}}},
        {{{0, 0}, {4e-10, 0}, {8e-10, 0}, {1.2e-9, 0}, {5, 5}, {5, 5}, {6, 6}},
         {{0, 0}, {5, 5}, {6, 6}}},
        {{{0, 0}, {1, 0}, {1, 1}, {0, 0}}, {{0, 0}, {1, 0}, {1, 1}, {0, 0}}},  // closing point
    };
    for (const auto& c : cases)
        EXPECT_EQ(PointsOf(Make(c.first)), c.second) << "case " << (&c - cases);
}

TEST(Polygon, EmptyPolygonHasInvertedBoxAndNullArrayWithPointsIsRefused) {
    const double big = std::numeric_limits<double>::max();
    for (P* array : {static_cast<P*>(nullptr), new P[0]}) {
        const Polygon<double> polygon(array, 0);
        EXPECT_EQ(polygon.numPoints, 0u);
        EXPECT_EQ(Box(polygon), (std::array<double, 4>{big, big, -big, -big}));
    }
    EXPECT_THROW(Polygon<double>(nullptr, 3), kestrel::DataException);
}

TEST(Polygon, CopiesAndAssignmentsOwnIndependentPoints) {
    auto source = std::make_unique<Polygon<double>>(Make({{1, 2}, {3, 4}}));
    source->reserved = 42;
    source->bbox.max.x = 99;  // no longer matches the points: the copy takes it as it is
    const Polygon<double> copy(*source);
    EXPECT_TRUE(copy.ownsPoints);
    EXPECT_EQ(copy.reserved, 42);
    EXPECT_EQ(Box(copy), (std::array<double, 4>{1, 2, 99, 4}));
    source->points[0].x = -7;
    source.reset();
    EXPECT_EQ(PointsOf(copy), (Pts{{1, 2}, {3, 4}}));

    // Only the kept points of a cleaned polygon are copied.
    EXPECT_EQ(PointsOf(Polygon<double>(Make({{1, 1}, {1, 1}, {2, 2}}))), (Pts{{1, 1}, {2, 2}}));

    Polygon<double> target = Make({{9, 9}});
    target = copy;
    EXPECT_NE(target.points, copy.points);
    Polygon<double>& alias = target;
    target = alias;
    EXPECT_EQ(PointsOf(target), (Pts{{1, 2}, {3, 4}}));
}
