// Lines, outlines, saved outlines, matte growth, the feather's geometry helpers, the band
// ramps, and lines through cameras.
#include <cstdio>
#include <fstream>
#include <iterator>
#include <set>
#include <string>

#include "failure_check.hpp"
#include "pixmap_test_util.hpp"

namespace {

using namespace pixmap_test;
using plano_test::fails_with;

using Pixels = std::set<std::pair<int32_t, int32_t>>;  // (row, column)

Pixels set_pixels(const Plx_Image *bits)
{
    Pixels s;
    for (int32_t r = 0; r < bits->height; ++r)
        for (int32_t c = 0; c < bits->width; ++c)
            if (plx_image_get_bit(bits, r, c)) s.insert({r, c});
    return s;
}

// The Bresenham line written independently: the minor coordinate at major step k is
// floor(k minor / major + 1/2), shifted across the main direction by each thickness offset.
Pixels reference_line(int32_t r0, int32_t c0, int32_t r1, int32_t c1, int32_t thickness, int32_t h, int32_t w)
{
    Pixels s;
    const int64_t dr = r1 - r0, dc = c1 - c0;
    const bool rows_major = std::llabs(dr) >= std::llabs(dc);
    const int64_t major = rows_major ? std::llabs(dr) : std::llabs(dc);
    const int64_t minor = rows_major ? std::llabs(dc) : std::llabs(dr), divisor = std::max<int64_t>(major, 1);
    for (int32_t off = -(thickness - 1) / 2; off <= thickness / 2; ++off)
        for (int64_t k = 0; k <= major; ++k) {
            const int64_t m = (2 * k * minor + major) / (2 * divisor);
            int64_t r = rows_major ? r0 + (dr > 0 ? k : -k) : r0 + (dr > 0 ? m : -m) + off;
            int64_t c = rows_major ? c0 + (dc > 0 ? m : -m) + off : c0 + (dc > 0 ? k : -k);
            if (r >= 0 && c >= 0 && r < h && c < w) s.insert({int32_t(r), int32_t(c)});
        }
    return s;
}

TEST(PixmapDrawing, LinesFollowBresenhamWithThickness)
{
    const double one = 1;
    struct Case {
        int32_t r0, c0, r1, c1, thickness;
    } cases[] = {
        {5, 2, 5, 10, 1},  {5, 2, 5, 10, 2},  {5, 2, 5, 10, 3},   {3, 4, 17, 9, 2},  {20, 1, 2, 30, 3},
        {0, 0, 19, 39, 1}, {19, 39, 0, 0, 4}, {-5, -8, 30, 50, 1}, {7, 7, 7, 7, 1},
        // Ends outside the image, in both directions: the walk joins the line part-way.
        {-30, 50, 25, -2, 3}, {40, 70, -10, 3, 2},
    };
    for (const Case &c : cases) {
        ImagePtr bits = bit_image(20, 40, 3, -2);
        ASSERT_TRUE(bImageDrawLine(bits.get(), c.r0 - 2, c.c0 + 3, c.r1 - 2, c.c1 + 3, &one, uint32_t(c.thickness)));
        EXPECT_EQ(set_pixels(bits.get()), reference_line(c.r0, c.c0, c.r1, c.c1, c.thickness, 20, 40))
            << c.r0 << "," << c.c0 << " -> " << c.r1 << "," << c.c1 << " t " << c.thickness;
    }
    // Far ends are brought in along the line, which keeps its place; zero thickness is refused.
    ImagePtr far = bit_image(20, 40);
    ASSERT_TRUE(bImageDrawLine(far.get(), 10, -2000000000, 10, 2000000000, &one, 1));
    EXPECT_EQ(plx_image_bit_count(far.get()), 40u);
    EXPECT_TRUE(plx_image_get_bit(far.get(), 10, 0));
    // A long line of absurd thickness covers the image, in time bounded by the image.
    ImagePtr thick = bit_image(20, 40);
    ASSERT_TRUE(bImageDrawLine(thick.get(), -150000, -150000, 150000, 150000, &one, 4000000000u));
    EXPECT_EQ(plx_image_bit_count(thick.get()), 800u);
    EXPECT_TRUE(fails_with(bImageDrawLine(far.get(), 0, 0, 5, 5, &one, 0), PLX_ERROR_INCOMPATIBLE));
}

TEST(PixmapDrawing, PolygonOutlineAndSavedFile)
{
    PolygonPtr p = closed_polygon({{12.7f, 22.2f}, {18.1f, 22.9f}, {18.5f, 28.0f}, {12.2f, 28.3f}});
    ImagePtr bits = bit_image(20, 20, 10, 20);
    const double one = 1;
    ASSERT_TRUE(bImageDrawPolygon(bits.get(), p.get(), &one, 1));
    EXPECT_EQ(plx_image_bit_count(bits.get()), 24u);  // the 7 x 7 square's outline

    const std::string path = ::testing::TempDir() + "polygon_outline.pgm";
    ASSERT_TRUE(bImageSavePolygon(path.c_str(), POLYGON2D_FILE_PGM, p.get()));
    std::ifstream in(path, std::ios::binary);
    const std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    const std::string header = "P5\n7 7\n255\n";
    ASSERT_EQ(bytes.substr(0, header.size()), header);
    EXPECT_EQ(std::count(bytes.begin() + long(header.size()), bytes.end(), char(255)), 24);
    EXPECT_EQ(bytes.size(), header.size() + 49);
    std::remove(path.c_str());
    EXPECT_TRUE(fails_with(bImageSavePolygon(path.c_str(), 7, p.get()), PLX_ERROR_ILLEGAL_FORMAT));
    EXPECT_TRUE(fails_with(bImageSavePolygon("/nonexistent-dir/x.pgm", 0, p.get()), PLX_ERROR_OPENING_FILE));
}

TEST(PixmapDrawing, ExpandMatteGrowsAndShrinksSquares)
{
    ImagePtr bits = bit_image(30, 40);
    plx_image_set_bit(bits.get(), 10, 33, 1);
    ASSERT_TRUE(bExpandMatte(bits.get(), 0));
    EXPECT_EQ(plx_image_bit_count(bits.get()), 1u);
    ASSERT_TRUE(bExpandMatte(bits.get(), 2));
    EXPECT_EQ(plx_image_bit_count(bits.get()), 25u);
    EXPECT_TRUE(plx_image_get_bit(bits.get(), 12, 35));
    ASSERT_TRUE(bExpandMatte(bits.get(), -2));
    EXPECT_EQ(set_pixels(bits.get()), (Pixels{{10, 33}}));
    ImagePtr grey(plx_image_form_gen_gl_uc(nullptr, 4, 4));
    EXPECT_TRUE(fails_with(bExpandMatte(grey.get(), 1), PLX_ERROR_ILLEGAL_PIXEL_TYPE));
}

TEST(PixmapFeatherGeometry, OffsetPointsAndInwardsDirection)
{
    // A straight chain: the offsets are the edge's normal scaled by each end's width.
    PolygonPtr p = closed_polygon({{0, 0, 2}, {10, 0, 3}, {20, 0, 3}, {10, 10, 3}});
    const Polygon2DEdge *e = p->head->next;  // (10, 0) -> (20, 0)
    Plx_Vector2_f sm, em, sp, ep;
    ASSERT_TRUE(bBuildPointsEitherSideOfLine(e, p->head, nullptr, &sm, &em, &sp, &ep));
    const float got[5] = {sm.x, sm.y, sp.y, em.x, em.y}, want[5] = {10, 3, -3, 20, 3};
    for (int i = 0; i < 5; ++i) EXPECT_FLOAT_EQ(got[i], want[i]) << i;
    // A neighbour folding straight back cancels the normal: the plain outline points.
    PolygonPtr back = closed_polygon({{0, 0, 2}, {10, 0, 2}, {0, 0, 2}});
    ASSERT_TRUE(bBuildPointsEitherSideOfLine(back->head, back->tail, back->head->next, &sm, &em, &sp, &ep));
    EXPECT_TRUE(sm.x == 0 && sm.y == 0 && ep.x == 10 && ep.y == 0);

    // A mask set below row 10: probing down finds the inside.
    ImagePtr mask = bit_image(20, 20, 5, 0);
    for (int32_t r = 10; r < 20; ++r)
        for (int32_t c = 0; c < 20; ++c) plx_image_set_bit(mask.get(), r, c, 1);
    const Plx_Vector2_f o{15, 9.5f}, up{15, 5}, down{15, 15}, side{18, 9.5f};
    struct Case {
        Plx_Vector2_f a, b;
        uint32_t result;
    } cases[] = {{down, up, 0}, {up, down, 1}, {side, up, 2}};
    for (const Case &c : cases) {
        uint32_t result = 9;
        ASSERT_TRUE(bDetermineInwardsDirection(mask.get(), &o, &c.a, &c.b, &result));
        EXPECT_EQ(result, c.result);
    }
    uint32_t result;
    EXPECT_TRUE(fails_with(bDetermineInwardsDirection(mask.get(), &o, &o, &up, &result), PLX_ERROR_DIVISION_BY_ZERO));
    ImagePtr f(plx_image_form_gen_gl_f(nullptr, 4, 4));
    EXPECT_TRUE(fails_with(bDetermineInwardsDirection(f.get(), &o, &up, &down, &result), PLX_ERROR_ILLEGAL_TYPE));
}

TEST(PixmapFeatherGeometry, QuadrilateralRampAndSoftEdge)
{
    // A band from S-E on y = 10 to a-b on y = 20, or to y = 0: rows are multiplied by the
    // distance from S-E over 10; the half band beyond S-E is cleared within rows 8..22 (the
    // corners' whole-pixel box widened by 2), the rest untouched.
    for (const float far_y : {20.0f, 0.0f}) {
        ImagePtr grey(plx_image_form_gen_gl_uc(nullptr, 40, 40));
        const double full = 200;
        ASSERT_TRUE(plx_image_fill_const(grey.get(), &full));
        const Plx_Vector2_f s{5, 10}, e{35, 10}, a{5, far_y}, b{35, far_y};
        ASSERT_TRUE(bFillQuadrilateralWithRampGreyUchar(grey.get(), &a, &b, &s, &e));
        for (int32_t r = 0; r < 40; ++r) {
            const double lambda = (r + 0.5 - 10) / (far_y - 10);
            const bool in_box = r >= std::min(far_y, 10.0f) - 2 && r <= std::max(far_y, 10.0f) + 2;
            const int want = !in_box                            ? 200
                             : lambda >= -0.5 && lambda < 0     ? 0
                             : lambda >= 0 && lambda < 1        ? int(200 * lambda)
                                                                : 200;
            EXPECT_EQ(static_cast<const uint8_t *>(plx_image_row(grey.get(), r))[20], want) << far_y << " " << r;
        }
    }

    // Soft edge between two squares 10 apart: 1 on the inner one falling to 0 on the outer,
    // continuous round the corners (no gaps, no pixel over 1).
    std::vector<Vertex> inner, outer;
    for (int k = 0; k < 40; ++k) {
        const float f = float(k % 10) / 10.0f;
        const int side = k / 10;
        const float ix[4] = {20 + 40 * f, 60, 60 - 40 * f, 20}, iy[4] = {20, 20 + 40 * f, 60, 60 - 40 * f};
        const float ox[4] = {10 + 60 * f, 70, 70 - 60 * f, 10}, oy[4] = {10, 10 + 60 * f, 70, 70 - 60 * f};
        inner.push_back({ix[side], iy[side]});
        outer.push_back({ox[side], oy[side]});
    }
    PolygonPtr pi = closed_polygon(inner), po = closed_polygon(outer);
    ImagePtr f(plx_image_form_gen_gl_f(nullptr, 80, 80));
    ASSERT_TRUE(plx_image_fill_zero(f.get()));
    ASSERT_TRUE(bFillPolygonSoftEdge(pi.get(), po.get(), f.get(), nullptr, nullptr));
    auto value = [&f](int32_t r, int32_t c) { return static_cast<const float *>(plx_image_row(f.get(), r))[c]; };
    EXPECT_NEAR(value(15, 40), 0.55f, 1e-4);  // 5.5 beyond the inner side at y = 20
    EXPECT_NEAR(value(40, 63), 0.65f, 1e-4);
    for (int32_t r = 11; r < 69; ++r)
        for (int32_t c = 11; c < 69; ++c) {
            const bool band = r < 20 || r >= 60 || c < 20 || c >= 60;
            ASSERT_EQ(value(r, c) > 0.0f, band) << c << "," << r;
            ASSERT_LE(value(r, c), 1.0f);
        }
    ImagePtr scratch = bit_image(80, 80);
    for (Plx_Image *other : {static_cast<Plx_Image *>(nullptr), scratch.get()})
        EXPECT_TRUE(fails_with(bFillPolygonSoftEdge(pi.get(), po.get(), f.get(), scratch.get(), other),
                               PLX_ERROR_ILLEGAL_ARGUMENT));
    inner.pop_back();
    PolygonPtr shorter = closed_polygon(inner);
    EXPECT_TRUE(fails_with(bFillPolygonSoftEdge(shorter.get(), po.get(), f.get(), nullptr, nullptr), PLX_ERROR_INCOMPATIBLE));
}

TEST(PixmapCameraLines, SampledThroughTheCamera)
{
    Plx_Camera linear, radial;
    ASSERT_TRUE(plx_camera_build_linear(&linear, 1.0, 100.0, 100.0, 50.0, 40.0));
    ASSERT_TRUE(plx_camera_build_radial_1(&radial, 1.0, 100.0, 100.0, 50.0, 40.0, 0.1));
    const double start[2] = {0.0, 0.0}, end[2] = {1.0, 0.5};
    PolygonPtr p(pPolygon2DNew());
    ASSERT_TRUE(bPolygonRenderLine(p.get(), &linear, start, end));
    EXPECT_GE(uiPolygon2DNumberOfPoints(p.get()), 11u);
    for (const Polygon2DEdge *e = p->head; e != nullptr; e = e->next)
        EXPECT_NEAR((e->y - 40) * 2, e->x - 50, 1e-3);  // on the straight image line
    EXPECT_FLOAT_EQ(p->tail->x, 150.0f);
    // With distortion the ends land where the camera puts them and the middle bends.
    PolygonPtr q(pPolygon2DNew());
    ASSERT_TRUE(bPolygonRenderLine(q.get(), &radial, start, end));
    const Plx_Vector3 far_end{1.0, 0.5, 1.0};
    Plx_Vector3 pixel;
    ASSERT_TRUE(plx_camera_project_point(&radial, &far_end, &pixel));
    EXPECT_NEAR(q->tail->x, pixel.x, 1e-3);
    EXPECT_NEAR(q->tail->y, pixel.y, 1e-3);

    // A segment from behind the camera is cut where it enters the widened view (x/z = 4).
    const double a3[3] = {0.0, 0.0, -1.0}, b3[3] = {0.5, 0.2, 2.0};
    PolygonPtr r(pPolygon2DNew());
    ASSERT_TRUE(bPolygonRenderLineCombined(r.get(), &linear, a3, b3, 100.0, 100.0));
    EXPECT_NEAR(r->head->x, 50 + 100 * 4.0, 0.5);
    EXPECT_NEAR(r->tail->x, 50 + 100 * 0.25, 1e-3);
    const double behind[3] = {0.0, 0.0, -2.0};
    EXPECT_TRUE(fails_with(bPolygonRenderLineCombined(r.get(), &linear, a3, behind, 100.0, 100.0), PLX_ERROR_INCOMPATIBLE));

    // A length that is not a number, or too long to count, draws nothing; one that needs
    // more samples than are worth storing is refused.
    const uint32_t before = uiPolygon2DNumberOfPoints(p.get());
    for (const double far : {double(NAN), 1e300, double(INFINITY)}) {
        const double away[2] = {far, 0.0};
        EXPECT_TRUE(bPolygonRenderLine(p.get(), &linear, start, away));
    }
    EXPECT_EQ(uiPolygon2DNumberOfPoints(p.get()), before);
    const double long_way[2] = {2e6, 0.0};
    EXPECT_TRUE(fails_with(bPolygonRenderLine(p.get(), &linear, start, long_way), PLX_ERROR_ILLEGAL_ARGUMENT));
}

}  // namespace
