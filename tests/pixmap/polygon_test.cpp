// Polygon2D: building and editing the chain, crossings, separation, the bounding box.
#include "failure_check.hpp"
#include "pixmap_test_util.hpp"

namespace {

using namespace pixmap_test;
using plano_test::fails_with;

std::vector<Vertex> vertices_of(const Polygon2D *p)
{
    std::vector<Vertex> v;
    for (const Polygon2DEdge *e = p->head; e != nullptr; e = e->next) v.push_back({e->x, e->y, e->start_width, e->start_t});
    return v;
}

TEST(PixmapPolygon2D, BuildingThinsClosesAndFinishes)
{
    PolygonPtr p(pPolygon2DNew());
    EXPECT_EQ(uiPolygon2DNumberOfPoints(p.get()), 0u);
    EXPECT_EQ(p->edge_sense, 1u);
    vPolygon2DSetDistanceThreshold(p.get(), 0.2f);
    ASSERT_TRUE(bPolygon2DAddWidePointWithT(p.get(), 0, 0, 1, 0));
    ASSERT_TRUE(bPolygon2DAddWidePointWithT(p.get(), 0.1f, 0.1f, 1, 0.1f));  // within 0.2: dropped
    EXPECT_EQ(uiPolygon2DNumberOfPoints(p.get()), 1u);
    ASSERT_TRUE(bPolygon2DAddWidePointWithT(p.get(), 0, 0, 1.3f, 0.2f));  // width differs by 0.3: kept
    EXPECT_EQ(uiPolygon2DNumberOfPoints(p.get()), 2u);
    // y comes first: this vertex is at column 5, row 2.
    ASSERT_TRUE(bPolygon2DAddWidePointWithT(p.get(), 2, 5, 1, 0.5f));
    ASSERT_TRUE(bPolygon2DAddWidePointWithT(p.get(), 0.05f, 0.1f, 1, 0.9f));  // near the head
    EXPECT_EQ(p->tail->x, 0.1f);
    EXPECT_EQ(p->tail->previous->x, 5.0f);
    EXPECT_EQ(p->tail->previous->y, 2.0f);
    EXPECT_TRUE(chain_consistent(p.get(), false));
    ASSERT_TRUE(bPolygon2DClose(p.get()));  // the tail lies within 0.2 of the head: dropped
    EXPECT_EQ(uiPolygon2DNumberOfPoints(p.get()), 3u);
    EXPECT_TRUE(chain_consistent(p.get(), true));

    PolygonPtr open(pPolygon2DNew());
    ASSERT_TRUE(bPolygon2DAddWidePointWithT(open.get(), 1, 2, 0, 0));
    ASSERT_TRUE(bPolygon2DAddWidePointWithT(open.get(), 3, 4, 0, 1));
    ASSERT_TRUE(bPolygon2DFinishOpen(open.get()));
    ASSERT_EQ(uiPolygon2DNumberOfPoints(open.get()), 1u);
    EXPECT_EQ(open->head->end_x, 4.0f);
    EXPECT_EQ(open->head->end_y, 3.0f);
    EXPECT_EQ(open->head->end_t, 1.0f);
}

TEST(PixmapPolygon2D, DeleteScaleAndCopy)
{
    PolygonPtr p = closed_polygon({{0, 0, 1, 0}, {10, 0, 2, 0.25f}, {10, 10, 3, 0.5f}, {0, 10, 4, 0.75f}});
    vPolygon2DSetDistanceThreshold(p.get(), 3.0f);
    PolygonPtr copy(pPolygon2DCopy(p.get()));
    EXPECT_EQ(copy->distance_threshold_squared, 0.0f);
    EXPECT_TRUE(chain_consistent(copy.get(), true));

    // Deleting after the tail drops the head's vertex.
    ASSERT_TRUE(bPolygon2DDeleteNextEdge(p.get(), p->tail));
    ASSERT_EQ(uiPolygon2DNumberOfPoints(p.get()), 3u);
    EXPECT_EQ(p->head->x, 10.0f);
    EXPECT_TRUE(chain_consistent(p.get(), true));
    // Deleting after the record before the tail drops the tail.
    ASSERT_TRUE(bPolygon2DDeleteNextEdge(p.get(), p->tail->previous));
    EXPECT_EQ(p->tail->x, 10.0f);
    EXPECT_EQ(p->tail->y, 10.0f);
    EXPECT_TRUE(chain_consistent(p.get(), true));

    // The last record goes whatever record the caller names (here one of another polygon).
    PolygonPtr one = closed_polygon({{1, 1}});
    ASSERT_TRUE(bPolygon2DDeleteNextEdge(one.get(), p->head));
    EXPECT_EQ(uiPolygon2DNumberOfPoints(one.get()), 0u);
    EXPECT_EQ(uiPolygon2DNumberOfPoints(p.get()), 2u);

    ASSERT_TRUE(bPolygon2DScalePoints(copy.get(), 2.0f, 3.0f));
    EXPECT_EQ(copy->head->next->x, 30.0f);
    EXPECT_EQ(copy->tail->end_y, 0.0f);
    EXPECT_EQ(copy->tail->y, 20.0f);
    EXPECT_EQ(copy->head->next->start_width, 5.0f);
    EXPECT_TRUE(chain_consistent(copy.get(), true));
}

TEST(PixmapPolygon2D, BoundingBox)
{
    struct Case {
        std::vector<Vertex> v;
        bool ok;
        uint32_t box[4];
    } cases[] = {
        {{{1.5f, 2.5f}, {7.9f, 2.5f}, {3.0f, 9.2f}}, true, {1, 2, 7, 8}},
        {{{1.5f, 3.0f}, {7.9f, 3.0f}}, true, {1, 3, 7, 1}},  // horizontal: height 1
        {{{4.0f, 1.0f}, {4.0f, 6.0f}}, false, {}},             // vertical: no extent in x
        {{}, false, {}},
    };
    for (const Case &c : cases) {
        PolygonPtr p = closed_polygon(c.v);
        uint32_t box[4] = {};
        if (!c.ok) {
            EXPECT_TRUE(fails_with(bPolygon2DGetBoundingBox(p.get(), box), PLX_ERROR_NO_DATA));
            continue;
        }
        ASSERT_TRUE(bPolygon2DGetBoundingBox(p.get(), box));
        for (int i = 0; i < 4; ++i) EXPECT_EQ(box[i], c.box[i]) << i;
    }
}

TEST(PixmapPolygon2D, SegmentCrossings)
{
    PolygonPtr p = closed_polygon({{0, 0, 2, 0}, {10, 0, 4, 1}, {10, 10}, {0, 10}});
    Plx_Vector2_f a{5, -5}, b{5, 5}, out{};
    ASSERT_TRUE(bIntersectLineWithPolygon(&a, &b, p.get(), p->tail, &out));
    EXPECT_FLOAT_EQ(out.x, 5.0f);
    EXPECT_FLOAT_EQ(out.y, 0.0f);
    // The nearest edge to the given record wins: starting at the third record finds the
    // crossing with the top edge first.
    Plx_Vector2_f c{5, 15};
    ASSERT_TRUE(bIntersectLineWithPolygon(&a, &c, p.get(), p->head->next->next, &out));
    EXPECT_FLOAT_EQ(out.y, 10.0f);
    // Exactly through a vertex is not a crossing (the interior tests are strict).
    Plx_Vector2_f d{-5, -5}, e{5, 5};
    plx_err_flush_trace();
    EXPECT_FALSE(bIntersectLineWithPolygon(&d, &e, p.get(), p->head, &out));
    EXPECT_EQ(plx_err_get_error_count(), 0u);  // no crossing is not a failure
}

// No two non-adjacent edges of the outline cross (brute force).
bool has_crossing(const Polygon2D *p)
{
    std::vector<const Polygon2DEdge *> r;
    for (const Polygon2DEdge *e = p->head; e != nullptr; e = e->next) r.push_back(e);
    auto cross = [](const Polygon2DEdge *a, const Polygon2DEdge *b) {
        auto side = [](double ax, double ay, double bx, double by, double px, double py) {
            return (bx - ax) * (py - ay) - (by - ay) * (px - ax);
        };
        const double d1 = side(a->x, a->y, a->end_x, a->end_y, b->x, b->y);
        const double d2 = side(a->x, a->y, a->end_x, a->end_y, b->end_x, b->end_y);
        const double d3 = side(b->x, b->y, b->end_x, b->end_y, a->x, a->y);
        const double d4 = side(b->x, b->y, b->end_x, b->end_y, a->end_x, a->end_y);
        return d1 * d2 < 0 && d3 * d4 < 0;
    };
    for (std::size_t i = 0; i < r.size(); ++i)
        for (std::size_t j = i + 2; j < r.size(); ++j)
            if (!(i == 0 && j + 1 == r.size()) && cross(r[i], r[j])) return true;
    return false;
}

TEST(PixmapPolygon2D, RemoveCrossingPointsCollapsesSmallLoops)
{
    // A square whose right side makes a small loop (a twist) near (20, 10), and one whose
    // small loop runs through the head.
    const std::vector<Vertex> twist = {{0, 0, 1}, {20, 0, 1}, {20, 9, 1}, {22, 11, 3}, {22, 9, 3},
                                       {20, 11, 1}, {20, 20, 1}, {0, 20, 1}};
    const std::vector<Vertex> through_head = {{22, 11, 3}, {22, 9, 3}, {20, 11, 1}, {20, 20},
                                              {0, 20},     {0, 0},     {20, 0},     {20, 9, 1}};
    for (const auto &v : {twist, through_head}) {
        PolygonPtr p = closed_polygon(v);
        ASSERT_TRUE(has_crossing(p.get()));
        ASSERT_TRUE(bPolygon2DRemoveCrossingPoints(p.get(), 100, 100));
        EXPECT_EQ(uiPolygon2DNumberOfPoints(p.get()), v.size());
        EXPECT_TRUE(chain_consistent(p.get(), true));
        EXPECT_FALSE(has_crossing(p.get()));
        // The loop collapsed onto the crossing at (21, 10), whose width is interpolated.
        int at_crossing = 0;
        for (const Vertex &q : vertices_of(p.get()))
            if (std::fabs(q.x - 21) < 1e-4 && std::fabs(q.y - 10) < 1e-4) {
                ++at_crossing;
                EXPECT_NEAR(q.width, 2.0f, 1e-4);
            }
        EXPECT_GE(at_crossing, 1);
    }
}

TEST(PixmapPolygon2D, SeparatePointsSpreadsBunchedRuns)
{
    // Three vertices bunched at (10, 0) on the bottom edge of a square.
    PolygonPtr p = closed_polygon({{0, 0}, {10, 0}, {10.1f, 0}, {10.2f, 0}, {20, 0}, {20, 20}, {0, 20}});
    ASSERT_TRUE(bPolygon2DSeparatePoints(p.get(), 1.0f));
    EXPECT_TRUE(chain_consistent(p.get(), true));
    const std::vector<Vertex> v = vertices_of(p.get());
    // Spread along the edge direction about where they were, 1 apart in all.
    EXPECT_NEAR(v[1].x, 9.5f, 1e-5);
    EXPECT_NEAR(v[2].x, 10.1f, 1e-5);
    EXPECT_NEAR(v[3].x, 10.7f, 1e-5);
    for (int i = 1; i <= 3; ++i) EXPECT_NEAR(v[i].y, 0.0f, 1e-6);
    EXPECT_EQ(v[0].x, 0.0f);
    EXPECT_EQ(v[4].x, 20.0f);
}

TEST(PixmapPolygon2D, RefusesNullArguments)
{
    EXPECT_TRUE(fails_with(bPolygon2DAddWidePointWithT(nullptr, 0, 0, 0, 0), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bPolygon2DClose(nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(pPolygon2DCopy(nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    PolygonPtr p(pPolygon2DNew());
    EXPECT_TRUE(fails_with(bPolygon2DDeleteNextEdge(p.get(), nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_EQ(uiPolygon2DNumberOfPoints(nullptr), 0u);
    vPolygon2DDelete(nullptr);
}

}  // namespace
