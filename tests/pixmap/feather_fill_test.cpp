// The feathered fill: closed-form ramps, order independence, T values, threads, refusals.
#include <cstring>

#include "failure_check.hpp"
#include "pixmap_test_util.hpp"
#include "plano_host/host.h"

namespace {

using namespace pixmap_test;
using plano_test::fails_with;

ImagePtr float_image(int32_t h, int32_t w, int32_t ox = 0, int32_t oy = 0)
{
    ImagePtr f(plx_image_form_gen_gl_f(nullptr, h, w));
    EXPECT_TRUE(plx_image_fill_zero(f.get()));
    f->x = ox, f->y = oy;
    return f;
}
float at(const Plx_Image *f, int32_t r, int32_t c) { return static_cast<const float *>(plx_image_row(f, r))[c]; }

// The square [x0, x1] x [y0, y1] with every side cut into pieces of 10, so that the offset
// lines away from the corners are parallel to the sides at exactly the width. T runs 0..1
// round the outline, a quarter per side.
std::vector<Vertex> subdivided_square(float x0, float y0, float x1, float y1, float width)
{
    const float cx[4] = {x0, x1, x1, x0}, cy[4] = {y0, y0, y1, y1};
    std::vector<Vertex> v;
    for (int side = 0; side < 4; ++side) {
        const int n = int(std::fmax(std::fabs(cx[(side + 1) % 4] - cx[side]), std::fabs(cy[(side + 1) % 4] - cy[side])) / 10);
        for (int k = 0; k < n; ++k) {
            const float f = float(k) / float(n);
            v.push_back({cx[side] + f * (cx[(side + 1) % 4] - cx[side]), cy[side] + f * (cy[(side + 1) % 4] - cy[side]),
                         width, 0.25f * (side + f)});
        }
    }
    return v;
}

float clamp01(double v) { return float(std::fmin(1.0, std::fmax(0.0, v))); }

// Feather values of each edge sense from the signed distance d (inside positive) and width w.
float expected(uint32_t sense, double d, double w)
{
    if (sense == 0) return d >= 0 ? 1.0f : clamp01(1.0 + d / w);
    if (sense == 2) return d >= 0 ? clamp01(d / w) : 0.0f;
    return clamp01(0.5 + 0.5 * d / w);
}

TEST(PixmapFeatherFill, StraightEdgesFollowTheClosedForm)
{
    const float w = 8.0f;
    for (uint32_t sense = 0; sense < 3; ++sense) {
        // A half-integer edge puts pixel centres exactly on the outline.
        PolygonPtr p = closed_polygon(subdivided_square(40.5f, 30.5f, 160.5f, 130.5f, w), sense);
        ImagePtr f = float_image(170, 210, -5, 3);
        ASSERT_TRUE(bImageFillPolygonAlpha(f.get(), nullptr, p.get(), nullptr, nullptr));
        int checked = 0;
        for (int32_t r = 0; r < 170; ++r)
            for (int32_t c = 0; c < 210; ++c) {
                const double x = c - 5 + 0.5, y = r + 3 + 0.5;
                // Signed distance to the nearest side; skip the corners, where the bands bend.
                const double dx = std::fmin(x - 40.5, 160.5 - x), dy = std::fmin(y - 30.5, 130.5 - y);
                if ((dx < 0 && dy < 0) || (std::fabs(dx) < 2 * w && std::fabs(dy) < 2 * w)) continue;
                const double d = std::fmin(dx, dy);
                // On the outline itself the value is exact (one half with sense 1).
                ASSERT_NEAR(at(f.get(), r, c), expected(sense, d, w), d == 0 ? 0.0 : 1e-5)
                    << "sense " << sense << " at " << x << "," << y;
                ++checked;
            }
        EXPECT_GT(checked, 15000);
    }
}

TEST(PixmapFeatherFill, LargeCircle)
{
    const double R = 150, w = 12, cx = 170.3, cy = 160.7;
    std::vector<Vertex> v;
    for (int i = 0; i < 720; ++i) {
        const double a = 2 * M_PI * i / 720;
        v.push_back({float(cx + R * std::cos(a)), float(cy + R * std::sin(a)), float(w), 0.0f});
    }
    PolygonPtr p = closed_polygon(v, 1);
    ImagePtr f = float_image(330, 340);
    ASSERT_TRUE(bImageFillPolygonAlpha(f.get(), nullptr, p.get(), nullptr, nullptr));
    // Within a pixel of the outline the inside mask (the hard fill, on truncated vertices)
    // may put a pixel centre on the other side, which moves it by at most its distance.
    double worst = 0, worst_near = 0;
    for (int32_t r = 0; r < 330; ++r)
        for (int32_t c = 0; c < 340; ++c) {
            const double rho = std::hypot(c + 0.5 - cx, r + 0.5 - cy);
            const double error = std::fabs(at(f.get(), r, c) - expected(1, R - rho, w));
            (std::fabs(R - rho) > 1.5 ? worst : worst_near) = std::fmax(std::fabs(R - rho) > 1.5 ? worst : worst_near, error);
        }
    EXPECT_LT(worst, 0.01);
    EXPECT_LT(worst_near, 1.5 / w);
}

// Values only rise outside and fall inside, so the order in which the edges are ramped
// (here: which vertex comes first) changes no bit; and sense 1 never crosses one half.
TEST(PixmapFeatherFill, OrderIndependentAndOnTheRightSide)
{
    std::mt19937 rng(21);
    std::uniform_real_distribution<float> width(0.0f, 9.0f);
    for (int trial = 0; trial < 12; ++trial) {
        std::vector<Vertex> v = trial % 2 ? star(rng, 30, 60, 50, 10, 45) : scribble(rng, 9, 0, 0, 120, 100);
        for (Vertex &q : v) q.width = width(rng);
        const uint32_t sense = uint32_t(trial % 3);
        std::vector<Vertex> shifted(v.begin() + 3, v.end());
        shifted.insert(shifted.end(), v.begin(), v.begin() + 3);
        ImagePtr a = float_image(100, 120), b = float_image(100, 120);
        ImagePtr inside = bit_image(100, 120);
        PolygonPtr pa = closed_polygon(v, sense), pb = closed_polygon(shifted, sense);
        ASSERT_TRUE(bImageFillPolygonBinaryImage(inside.get(), pa.get(), 1, 0));
        ASSERT_TRUE(bImageFillPolygonAlpha(a.get(), nullptr, pa.get(), nullptr, nullptr));
        ASSERT_TRUE(bImageFillPolygonAlpha(b.get(), inside.get(), pb.get(), nullptr, nullptr));
        for (int32_t r = 0; r < 100; ++r)
            for (int32_t col = 0; col < 120; ++col) {
                const float va = at(a.get(), r, col);
                ASSERT_EQ(va, at(b.get(), r, col)) << trial;
                const bool in = plx_image_get_bit(inside.get(), r, col) != 0;
                ASSERT_TRUE(va >= 0.0f && va <= 1.0f);
                const bool side_ok = sense == 0 ? !in || va == 1.0f : sense == 2 ? in || va == 0.0f
                                                                                 : in == (va >= 0.5f) || va == 0.5f;
                ASSERT_TRUE(side_ok) << trial << " at " << col << "," << r;
            }
    }
}

float show_t(float value, float t) { return value > 0.5f ? t : 0.0f; }
float squared(float value) { return value * value; }

TEST(PixmapFeatherFill, TValuesAlphaFunctionAndThreads)
{
    PolygonPtr p = closed_polygon(subdivided_square(20, 20, 220, 180, 6), 1);
    ImagePtr t = float_image(200, 240), f = float_image(200, 240);
    ASSERT_TRUE(bImageFillPolygonAlpha(f.get(), nullptr, p.get(), t.get(), show_t));
    // Just inside the edge from x = 120 to 130 of the first side (T 0.125 to 0.1375), of an
    // edge of the last side (T 0.96875 to 0.984375), and of the last edge, whose T wraps
    // from 0.984375 to the head's 0.
    EXPECT_NEAR(at(t.get(), 21, 125), 0.13125f, 1e-6);
    EXPECT_EQ(at(t.get(), 18, 125), 0.0f);  // outside: value below one half
    EXPECT_NEAR(at(t.get(), 35, 21), 0.9765625f, 1e-6);
    EXPECT_NEAR(at(t.get(), 28, 21), 0.9921875f, 1e-6);

    // The alpha function maps the written values.
    vPolygon2DSetAlphaFunc(p.get(), squared);
    ImagePtr g = float_image(200, 240);
    ASSERT_TRUE(bImageFillPolygonAlpha(g.get(), nullptr, p.get(), nullptr, nullptr));
    EXPECT_FLOAT_EQ(at(g.get(), 18, 125), at(f.get(), 18, 125) * at(f.get(), 18, 125));

    // Any number of jobs, or none, gives the same bits.
    std::mt19937 rng(5);
    std::vector<Vertex> v = star(rng, 300, 150, 130, 30, 120);
    for (Vertex &q : v) q.width = 15.0f;
    PolygonPtr star_p = closed_polygon(v, 1);
    ImagePtr reference = float_image(260, 300), ref_t = float_image(260, 300);
    ASSERT_TRUE(bImageFillPolygonAlphaThreaded(reference.get(), nullptr, star_p.get(), ref_t.get(), show_t, nullptr));
    for (uint32_t jobs : {1u, 3u, 8u}) {
        PlanoHost *host = plano_host_new(jobs);
        ImagePtr out = float_image(260, 300), out_t = float_image(260, 300);
        ASSERT_TRUE(bImageFillPolygonAlphaThreaded(out.get(), nullptr, star_p.get(), out_t.get(), show_t,
                                                   plano_host_interface(host)));
        for (int32_t r = 0; r < 260; ++r) {
            ASSERT_EQ(std::memcmp(plx_image_row(out.get(), r), plx_image_row(reference.get(), r), 300 * 4), 0) << jobs;
            ASSERT_EQ(std::memcmp(plx_image_row(out_t.get(), r), plx_image_row(ref_t.get(), r), 300 * 4), 0) << jobs;
        }
        vThreadedWorkerPoolFree();
        plano_host_free(host);
    }
}

TEST(PixmapFeatherFill, BlendsIntoGreyImagesAndRefusesBadInput)
{
    std::mt19937 rng(8);
    std::vector<Vertex> v = star(rng, 40, 50, 40, 10, 35);
    for (Vertex &q : v) q.width = 5.0f;
    PolygonPtr p = closed_polygon(v, 1);
    ImagePtr f = float_image(80, 100, 3, -2);
    ASSERT_TRUE(bImageFillPolygonAlpha(f.get(), nullptr, p.get(), nullptr, nullptr));
    ImagePtr grey(plx_image_form_gen_gl_uc(nullptr, 80, 100));
    grey->x = 3, grey->y = -2;
    const double forty = 40, two_hundred = 200;
    ASSERT_TRUE(plx_image_fill_const(grey.get(), &forty));
    ASSERT_TRUE(bImageFillPolygon(grey.get(), p.get(), &two_hundred, 0));
    for (int32_t r = 0; r < 80; ++r)
        for (int32_t c = 0; c < 100; ++c) {
            const float a = at(f.get(), r, c);
            const double want = std::floor((1 - a) * 40.0f + a * 200.0f + 0.5f);
            ASSERT_NEAR(static_cast<const uint8_t *>(plx_image_row(grey.get(), r))[c], want, 1.0) << c << "," << r;
        }
    // Absurd coordinates are clipped, not trusted.
    PolygonPtr wild = closed_polygon({{1e30f, 5, 5}, {-1e30f, 50, 5}, {NAN, 20, 5}, {40, -1e30f, 5}});
    EXPECT_TRUE(bImageFillPolygonAlpha(f.get(), nullptr, wild.get(), nullptr, nullptr));
    EXPECT_TRUE(bImageFillPolygon(grey.get(), wild.get(), &two_hundred, 0));
    ImagePtr rgb(plx_image_form_gen_rgb_uc(nullptr, 8, 8));
    const double pixel[3] = {1, 2, 3};
    EXPECT_TRUE(fails_with(bImageFillPolygon(rgb.get(), p.get(), pixel, 0), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bImageFillPolygonAlpha(grey.get(), nullptr, p.get(), nullptr, nullptr), PLX_ERROR_ILLEGAL_TYPE));
    ImagePtr small = bit_image(10, 10);
    EXPECT_TRUE(fails_with(bImageFillPolygonAlpha(f.get(), small.get(), p.get(), nullptr, nullptr), PLX_ERROR_INCOMPATIBLE));
    vPolygon2DSetEdgeSense(p.get(), 3);
    EXPECT_TRUE(fails_with(bImageFillPolygonAlpha(f.get(), nullptr, p.get(), nullptr, nullptr), PLX_ERROR_ILLEGAL_TYPE));
}

}  // namespace
