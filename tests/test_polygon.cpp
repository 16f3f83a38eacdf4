// The footprint polygon: bounds, removal of near-duplicate points, copies.
#include <silvan/polygon.h>

#include "support.h"

#include <algorithm>
#include <limits>
#include <memory>
#include <vector>

using kestrel::tin::Polygon;
using P = point2_t<double>;

namespace {

// A polygon made the way the readers make one: from a new[] array that it takes over.
Polygon<double> Make(const std::vector<P>& points) {
    P* array = new P[points.size()];
    std::copy(points.begin(), points.end(), array);
    return Polygon<double>(array, static_cast<unsigned int>(points.size()));
}

std::vector<P> PointsOf(const Polygon<double>& polygon) {
    return std::vector<P>(polygon.points, polygon.points + polygon.numPoints);
}

void ExpectPoints(const Polygon<double>& polygon, const std::vector<P>& expected) {
    const std::vector<P> actual = PointsOf(polygon);
    ASSERT_EQ(actual.size(), expected.size());
    for (std::size_t i = 0; i < expected.size(); ++i) {
        EXPECT_EQ(actual[i].x, expected[i].x) << "point " << i;
        EXPECT_EQ(actual[i].y, expected[i].y) << "point " << i;
    }
}

}  // namespace

TEST(Polygon, PointsAreTakenOverBoundedAndCleaned) {
    const Polygon<double> polygon = Make({{1, 1}, {1, 1}, {2, 2}});
    EXPECT_TRUE(polygon.ownsPoints);
    ExpectPoints(polygon, {{1, 1}, {2, 2}});
    EXPECT_EQ(polygon.bbox.min.x, 1.0);
    EXPECT_EQ(polygon.bbox.min.y, 1.0);
    EXPECT_EQ(polygon.bbox.max.x, 2.0);
    EXPECT_EQ(polygon.bbox.max.y, 2.0);
}

TEST(Polygon, BoxSpansEveryAxisSeparately) {
    const Polygon<double> polygon = Make({{3, -1}, {-2, 5}, {0.5, 7}});
    EXPECT_EQ(polygon.bbox.min.x, -2.0);
    EXPECT_EQ(polygon.bbox.min.y, -1.0);
    EXPECT_EQ(polygon.bbox.max.x, 3.0);
    EXPECT_EQ(polygon.bbox.max.y, 7.0);
}

TEST(Polygon, ToleranceIsStrictlyInsideOneNanometre) {
    // 1e-9 apart in x: both stay. 5e-10 apart in x, same y: the second goes.
    ExpectPoints(Make({{0, 0}, {1e-9, 0}}), {{0, 0}, {1e-9, 0}});
    ExpectPoints(Make({{0, 0}, {5e-10, 0}, {1, 1}}), {{0, 0}, {1, 1}});
    // Close in x but not in y: not a duplicate.
    ExpectPoints(Make({{0, 0}, {0, 1}}), {{0, 0}, {0, 1}});
    // Close in both, negative direction.
    ExpectPoints(Make({{1, 1}, {1 - 5e-10, 1 - 5e-10}}), {{1, 1}});
}

TEST(Polygon, CreepingRunCollapsesToItsFirstPoint) {
    // Each point is compared with its predecessor as given, not with the last one kept.
    ExpectPoints(Make({{0, 0}, {4e-10, 0}, {8e-10, 0}, {1.2e-9, 0}}), {{0, 0}});
    ExpectPoints(Make({{0, 0}, {4e-10, 0}, {8e-10, 0}, {1.2e-9, 0}, {5, 5}, {5, 5}, {6, 6}}),
                 {{0, 0}, {5, 5}, {6, 6}});
}

TEST(Polygon, ClosingPointIsKeptAndRingIsNotClosed) {
    ExpectPoints(Make({{0, 0}, {1, 0}, {1, 1}, {0, 0}}), {{0, 0}, {1, 0}, {1, 1}, {0, 0}});
    ExpectPoints(Make({{0, 0}, {1, 0}, {1, 1}}), {{0, 0}, {1, 0}, {1, 1}});
}

TEST(Polygon, BoxIsNotRecomputedAfterRemoval) {
    // The box is computed before the duplicates go and is not recomputed: it still covers the
    // dropped point.
    const Polygon<double> polygon = Make({{0, 0}, {5e-10, 5e-10}});
    ExpectPoints(polygon, {{0, 0}});
    EXPECT_EQ(polygon.bbox.max.x, 5e-10);
}

TEST(Polygon, EmptyPolygonHasInvertedBox) {
    const double big = std::numeric_limits<double>::max();
    for (P* array : {static_cast<P*>(nullptr), new P[0]}) {
        const Polygon<double> polygon(array, 0);
        EXPECT_EQ(polygon.numPoints, 0u);
        EXPECT_EQ(polygon.bbox.min.x, big);
        EXPECT_EQ(polygon.bbox.min.y, big);
        EXPECT_EQ(polygon.bbox.max.x, -big);
        EXPECT_EQ(polygon.bbox.max.y, -big);
    }
}

TEST(Polygon, NullArrayWithPointsIsRefused) {
    EXPECT_THROW(Polygon<double>(nullptr, 3), kestrel::DataException);
}

TEST(Polygon, NewBoxIsZero) {
    const kestrel::tin::BBox<double, P> box;
    EXPECT_EQ(box.min.x, 0.0);
    EXPECT_EQ(box.min.y, 0.0);
    EXPECT_EQ(box.max.x, 0.0);
    EXPECT_EQ(box.max.y, 0.0);
}

TEST(Polygon, CopyHasItsOwnPointsAndTheSourceBox) {
    auto source = std::make_unique<Polygon<double>>(Make({{1, 2}, {3, 4}}));
    source->reserved = 42;
    source->bbox.max.x = 99;  // no longer matches the points: the copy takes it as it is
    const Polygon<double> copy(*source);
    EXPECT_NE(copy.points, source->points);
    EXPECT_TRUE(copy.ownsPoints);
    EXPECT_EQ(copy.reserved, 42);
    EXPECT_EQ(copy.bbox.max.x, 99.0);
    EXPECT_EQ(copy.bbox.min.y, 2.0);

    source->points[0].x = -7;
    ExpectPoints(copy, {{1, 2}, {3, 4}});
    source.reset();
    ExpectPoints(copy, {{1, 2}, {3, 4}});
}

TEST(Polygon, CopyOfCleanedPolygonCopiesOnlyKeptPoints) {
    const Polygon<double> source = Make({{1, 1}, {1, 1}, {1, 1}, {2, 2}});
    const Polygon<double> copy(source);
    ExpectPoints(copy, {{1, 1}, {2, 2}});
}

TEST(Polygon, AssignmentReplacesPointsAndSurvivesSelfAssignment) {
    Polygon<double> target = Make({{9, 9}});
    const Polygon<double> source = Make({{1, 2}, {3, 4}});
    target = source;
    ExpectPoints(target, {{1, 2}, {3, 4}});
    EXPECT_NE(target.points, source.points);
    Polygon<double>& alias = target;
    target = alias;
    ExpectPoints(target, {{1, 2}, {3, 4}});
}
