// Helpers of the polygon tests: building polygons, images, and the independent references.
#ifndef PLANO_TESTS_PIXMAP_TEST_UTIL_HPP
#define PLANO_TESTS_PIXMAP_TEST_UTIL_HPP

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <memory>
#include <random>
#include <vector>

#include "pellux/image_test_util.hpp"
#include "plano/plano.h"

namespace pixmap_test {

struct PolygonDeleter {
    void operator()(Polygon2D *p) const { vPolygon2DDelete(p); }
};
using PolygonPtr = std::unique_ptr<Polygon2D, PolygonDeleter>;
using plx_test::ImagePtr;

struct Vertex {
    float x, y, width = 0.0f, t = 0.0f;
};

// A closed polygon through the vertices (x, y order here; the interface takes y first).
inline PolygonPtr closed_polygon(const std::vector<Vertex> &vertices, uint32_t sense = 1)
{
    PolygonPtr p(pPolygon2DNew());
    for (const Vertex &v : vertices) EXPECT_TRUE(bPolygon2DAddWidePointWithT(p.get(), v.y, v.x, v.width, v.t));
    EXPECT_TRUE(bPolygon2DClose(p.get()));
    vPolygon2DSetEdgeSense(p.get(), sense);
    return p;
}

// Every record's end equals its successor's start; a closed chain also wraps.
inline ::testing::AssertionResult chain_consistent(const Polygon2D *p, bool closed)
{
    for (const Polygon2DEdge *e = p->head; e != nullptr; e = e->next) {
        const Polygon2DEdge *n = e->next != nullptr ? e->next : closed ? p->head : nullptr;
        if (n == nullptr) break;
        if (e->end_x != n->x || e->end_y != n->y || e->end_width != n->start_width || e->end_t != n->start_t)
            return ::testing::AssertionFailure() << "record at (" << e->x << ", " << e->y << ") ends apart";
        if (e->next != nullptr && e->next->previous != e) return ::testing::AssertionFailure() << "broken back link";
    }
    return ::testing::AssertionSuccess();
}

// Random polygons: a star with sorted angles and random radii is simple (and mostly
// concave); free random vertices give self-intersecting ones.
inline std::vector<Vertex> star(std::mt19937 &rng, int n, float cx, float cy, float r0, float r1)
{
    std::uniform_real_distribution<float> radius(r0, r1), jitter(0.0f, 1.0f);
    std::vector<Vertex> v;
    for (int i = 0; i < n; ++i) {
        const double a = 2.0 * M_PI * (i + 0.8 * jitter(rng)) / n;
        const float r = radius(rng);
        v.push_back({cx + r * float(std::cos(a)), cy + r * float(std::sin(a))});
    }
    return v;
}
inline std::vector<Vertex> scribble(std::mt19937 &rng, int n, float x0, float y0, float x1, float y1)
{
    std::uniform_real_distribution<float> x(x0, x1), y(y0, y1);
    std::vector<Vertex> v;
    for (int i = 0; i < n; ++i) v.push_back({x(rng), y(rng)});
    return v;
}

// The hard-fill reference, written plainly: pixel (c, r) of an image at offset (ox, oy) is
// filled when its centre lies inside the outline with truncated vertices moved by half a
// pixel, even-odd, a crossing counting when it lies at or left of the centre. Everything is
// shifted by -0.5 so the arithmetic stays in exact integers.
inline bool reference_inside(const std::vector<Vertex> &v, int64_t X, int64_t Y)
{
    bool inside = false;
    for (std::size_t i = 0; i < v.size(); ++i) {
        const Vertex &p = v[i], &q = v[(i + 1) % v.size()];
        int64_t xa = int64_t(std::trunc(p.x)), ya = int64_t(std::trunc(p.y));
        int64_t xb = int64_t(std::trunc(q.x)), yb = int64_t(std::trunc(q.y));
        if ((ya <= Y) == (yb <= Y)) continue;
        if (ya > yb) std::swap(xa, xb), std::swap(ya, yb);
        // crossing x = xa + (Y - ya)(xb - xa)/(yb - ya) <= X
        if ((Y - ya) * (xb - xa) <= (X - xa) * (yb - ya)) inside = !inside;
    }
    return inside;
}

inline ImagePtr bit_image(int32_t h, int32_t w, int32_t ox = 0, int32_t oy = 0)
{
    ImagePtr b(plx_image_form_gen_b(nullptr, h, w));
    EXPECT_TRUE(plx_image_fill_zero(b.get()));
    b->x = ox, b->y = oy;
    return b;
}

}  // namespace pixmap_test

#endif
