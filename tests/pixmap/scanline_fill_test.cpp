// Hard fills: exact pixel sets against the pixel-centre reference, modes, and every image type.
#include "failure_check.hpp"
#include "pixmap_test_util.hpp"

namespace {

using namespace pixmap_test;
using plano_test::fails_with;

// Fills v into a bit image and compares every pixel with the reference.
::testing::AssertionResult matches_reference(const std::vector<Vertex> &v, int32_t h, int32_t w, int32_t ox,
                                             int32_t oy)
{
    ImagePtr bits = bit_image(h, w, ox, oy);
    PolygonPtr p = closed_polygon(v);
    if (!bImageFillPolygonBinaryImage(bits.get(), p.get(), 1, 0)) return ::testing::AssertionFailure() << "fill failed";
    for (int32_t r = 0; r < h; ++r)
        for (int32_t c = 0; c < w; ++c)
            if ((plx_image_get_bit(bits.get(), r, c) != 0) != reference_inside(v, c + ox, r + oy))
                return ::testing::AssertionFailure() << "pixel (" << c << ", " << r << ") differs";
    return ::testing::AssertionSuccess();
}

TEST(PixmapScanlineFill, UnitSquareExcludesRightColumnAndBottomRow)
{
    ImagePtr bits = bit_image(8, 8);
    PolygonPtr p = closed_polygon({{0, 0}, {4, 0}, {4, 4}, {0, 4}});
    ASSERT_TRUE(bImageFillPolygonBinaryImage(bits.get(), p.get(), 1, 0));
    EXPECT_EQ(plx_image_bit_count(bits.get()), 16u);
    Plx_Window box{};
    ASSERT_TRUE(plx_image_get_active_subwindow_b(bits.get(), &box));
    EXPECT_EQ(box.x, 0);
    EXPECT_EQ(box.width, 4);
    EXPECT_EQ(box.height, 4);
    // Only horizontal edges: nothing.
    ImagePtr none = bit_image(8, 8);
    PolygonPtr flat = closed_polygon({{0, 2}, {6, 2}, {3, 2.5f}});
    ASSERT_TRUE(bImageFillPolygonBinaryImage(none.get(), flat.get(), 1, 0));
    EXPECT_EQ(plx_image_bit_count(none.get()), 0u);
}

TEST(PixmapScanlineFill, RandomPolygonsMatchTheReference)
{
    std::mt19937 rng(15);
    std::uniform_int_distribution<int32_t> offset(-40, 40);
    for (int trial = 0; trial < 60; ++trial) {
        const int32_t h = 37 + trial, w = 70 - trial / 2, ox = offset(rng), oy = offset(rng);
        // Outlines spill past every side of the image and cross frame coordinate 0, where
        // truncation toward zero matters.
        const std::vector<Vertex> v =
            trial % 2 == 0 ? star(rng, 5 + trial, ox + w / 2.0f, oy + h / 2.0f, 5.0f, 0.8f * float(w))
                           : scribble(rng, 4 + trial / 3, ox - 15.0f, oy - 15.0f, ox + w + 15.0f, oy + h + 15.0f);
        EXPECT_TRUE(matches_reference(v, h, w, ox, oy)) << "trial " << trial;
    }
    // Far coordinates go through the clipped edge table; frame coordinates at the ends of
    // the 32-bit range still address the image.
    EXPECT_TRUE(matches_reference({{-1e6f, -1e6f}, {1e6f, -1e6f}, {1e6f, 1e6f}, {-1e6f, 1e6f}}, 20, 40, 5, -3));
    EXPECT_TRUE(matches_reference({{-2e5f, 10}, {30, 2}, {30, 18}}, 20, 40, 0, 0));
    EXPECT_TRUE(matches_reference({{2147483520.0f, -2147483648.0f}, {2147483648.0f, -2147483520.0f},
                                   {2147483520.0f, -2147483520.0f}},
                                  20, 40, 2147483500, -2147483640));
    // An infinite vertex fills towards it like a very far one, not as if its edges were gone.
    ImagePtr bits = bit_image(20, 40);
    PolygonPtr p = closed_polygon({{10, 2}, {INFINITY, 10}, {10, 18}});
    ASSERT_TRUE(bImageFillPolygonBinaryImage(bits.get(), p.get(), 1, 0));
    EXPECT_EQ(plx_image_bit_count(bits.get()), 16u * 30u);
    EXPECT_TRUE(plx_image_get_bit(bits.get(), 2, 10) && plx_image_get_bit(bits.get(), 17, 39));
}

TEST(PixmapScanlineFill, ModesAndRefusals)
{
    std::mt19937 rng(3);
    ImagePtr bits = bit_image(50, 77, 4, 9);
    std::bernoulli_distribution coin(0.5);
    for (int32_t r = 0; r < 50; ++r)
        for (int32_t c = 0; c < 77; ++c) plx_image_set_bit(bits.get(), r, c, coin(rng));
    ImagePtr before(plx_image_copy_q(bits.get(), nullptr));
    PolygonPtr p = closed_polygon(scribble(rng, 9, 0, 0, 90, 70));
    ASSERT_TRUE(bImageFillPolygonBinaryImage(bits.get(), p.get(), 0, 1));
    ImagePtr diff(plx_image_copy_q(bits.get(), nullptr));
    ASSERT_TRUE(plx_image_bit_eor_q(diff.get(), before.get(), diff.get()));
    EXPECT_GT(plx_image_bit_count(diff.get()), 0u);
    ASSERT_TRUE(bImageFillPolygonBinaryImage(bits.get(), p.get(), 0, 2));  // invert again: restored
    ASSERT_TRUE(plx_image_bit_eor_q(bits.get(), before.get(), diff.get()));
    EXPECT_EQ(plx_image_bit_count(diff.get()), 0u);
    // Mode 0 with value 0 clears exactly what value 1 sets.
    ASSERT_TRUE(bImageFillPolygonBinaryImage(bits.get(), p.get(), 0, 0));
    ImagePtr covered = bit_image(50, 77, 4, 9);
    ASSERT_TRUE(bImageFillPolygonBinaryImage(covered.get(), p.get(), 1, 0));
    ASSERT_TRUE(plx_image_bit_and_q(bits.get(), covered.get(), diff.get()));
    EXPECT_EQ(plx_image_bit_count(diff.get()), 0u);

    EXPECT_TRUE(fails_with(bImageFillPolygonBinaryImage(bits.get(), p.get(), 1, 3), PLX_ERROR_ILLEGAL_TYPE));
    ImagePtr grey(plx_image_form_gen_gl_uc(nullptr, 4, 4));
    EXPECT_TRUE(fails_with(bImageFillPolygonBinaryImage(grey.get(), p.get(), 1, 0), PLX_ERROR_ILLEGAL_PIXEL_TYPE));
    EXPECT_TRUE(fails_with(bImageFillPolygonBinaryImage(nullptr, p.get(), 1, 0), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bImageFillPolygonBinaryImage(bits.get(), nullptr, 1, 0), PLX_ERROR_ILLEGAL_ARGUMENT));
}

// bImageFillPolygon without widths writes the pixel exactly where the bit fill sets bits and
// leaves every other pixel alone, for each format and type.
TEST(PixmapScanlineFill, HardFillOfEveryImageType)
{
    struct Case {
        Plx_ImageFormat format;
        Plx_PixelType type;
        double pixel[4];
    } cases[] = {
        {PLX_FORMAT_GREY, PLX_TYPE_UCHAR, {200}},         {PLX_FORMAT_GREY, PLX_TYPE_USHORT, {60000}},
        {PLX_FORMAT_GREY, PLX_TYPE_INT, {-7}},            {PLX_FORMAT_GREY, PLX_TYPE_UINT, {4000000000.0}},
        {PLX_FORMAT_GREY, PLX_TYPE_FLOAT, {0.25}},        {PLX_FORMAT_GREY, PLX_TYPE_DOUBLE, {-1.5}},
        {PLX_FORMAT_RGB, PLX_TYPE_UCHAR, {1, 2, 3}},      {PLX_FORMAT_RGBA, PLX_TYPE_FLOAT, {0.125, 0.25, 0.375, 1}},
        {PLX_FORMAT_GREY_ALPHA, PLX_TYPE_USHORT, {9, 8}}, {PLX_FORMAT_VECTOR2D, PLX_TYPE_DOUBLE, {0.5, -2}},
    };
    std::mt19937 rng(7);
    const std::vector<Vertex> v = star(rng, 40, 30, 20, 4, 30);
    PolygonPtr p = closed_polygon(v);
    ImagePtr mask = bit_image(41, 67, -3, 2);
    ASSERT_TRUE(bImageFillPolygonBinaryImage(mask.get(), p.get(), 1, 0));
    for (const Case &c : cases) {
        ImagePtr image(plx_image_form_gen(nullptr, c.format, c.type, 41, 67));
        image->x = -3, image->y = 2;
        const double background[4] = {5, 5, 5, 5};
        ASSERT_TRUE(plx_image_fill_const(image.get(), background));
        ASSERT_TRUE(bImageFillPolygon(image.get(), p.get(), c.pixel, 0));
        const uint32_t channels = plx_image_format_channels(c.format);
        for (int32_t r = 0; r < 41; ++r)
            for (int32_t col = 0; col < 67; ++col) {
                double got[4];
                ASSERT_TRUE(plx_image_get_pixel(image.get(), r, col, got));
                const bool in = plx_image_get_bit(mask.get(), r, col) != 0;
                for (uint32_t k = 0; k < channels; ++k)
                    ASSERT_EQ(got[k], in ? c.pixel[k] : 5.0) << c.format << "/" << c.type << " at " << col << "," << r;
            }
        EXPECT_TRUE(fails_with(bImageFillPolygon(image.get(), p.get(), c.pixel, 1), PLX_ERROR_ILLEGAL_ARGUMENT));
    }
    // Bit images take the pixel's bit and the mode.
    ImagePtr bits = bit_image(41, 67, -3, 2);
    const double one = 1.0;
    ASSERT_TRUE(bImageFillPolygon(bits.get(), p.get(), &one, 1));
    EXPECT_EQ(plx_image_bit_count(bits.get()), plx_image_bit_count(mask.get()));
}

}  // namespace
