// Single pixels, fills and the active subwindow of value images.
#include "image_test_util.hpp"

using namespace plx_test;

TEST(ImagePixel, ValuesRoundTripRoundedAndClamped)
{
    const struct {
        Plx_PixelType type;
        double in, out;
    } cases[] = {
        {PLX_TYPE_UCHAR, 300, 255},   {PLX_TYPE_UCHAR, 2.5, 3},        {PLX_TYPE_USHORT, -3, 0},
        {PLX_TYPE_INT, -2.5, -3},     {PLX_TYPE_UINT, 4294967295.0, 4294967295.0},
        {PLX_TYPE_FLOAT, 0.1, double(0.1f)}, {PLX_TYPE_BIT, 0.5, 1}, {PLX_TYPE_BIT, 0.49, 0},
    };
    for (const auto &c : cases) {
        ImagePtr im = make(PLX_FORMAT_GREY, c.type, 3, 40);
        set(im.get(), 2, 37, {c.in});
        EXPECT_EQ(pixel(im.get(), 2, 37)[0], c.out) << "type " << c.type << " value " << c.in;
    }
    ImagePtr bgra = make(PLX_FORMAT_BGRA, PLX_TYPE_USHORT, 2, 2);
    set(bgra.get(), 1, 1, {1, 2, 3, 4});  // stored as given, blue first
    EXPECT_EQ(static_cast<uint16_t *>(plx_image_row(bgra.get(), 1))[4], 1);
    EXPECT_EQ(static_cast<uint16_t *>(plx_image_row(bgra.get(), 1))[7], 4);

    // One pixel converted: float RGB to 8-bit BGRA, and to a bit at an odd column.
    ImagePtr rgb = make(PLX_FORMAT_RGB, PLX_TYPE_FLOAT, 1, 2);
    set(rgb.get(), 0, 1, {1.0, 0.5, 0.0});
    ASSERT_TRUE(plx_image_convert_pixel(rgb.get(), 0, 1, bgra.get(), 0, 0));
    EXPECT_EQ(pixel(bgra.get(), 0, 0), (std::vector<double>{0, 32768, 65535, 65535}));
    ImagePtr bits = make(PLX_FORMAT_GREY, PLX_TYPE_BIT, 2, 70);
    ASSERT_TRUE(plx_image_convert_pixel(rgb.get(), 0, 1, bits.get(), 1, 67));  // luminance 0.57
    EXPECT_EQ(plx_image_bit_count(bits.get()), 1u);
    EXPECT_TRUE(plx_image_get_bit(bits.get(), 1, 67));

    ImagePtr ptrs = make(PLX_FORMAT_POINTER, PLX_TYPE_POINTER, 2, 3);
    plx_image_fill_zero(ptrs.get());
    int target = 0;
    plx_image_set_pointer(ptrs.get(), 1, 2, &target);
    EXPECT_EQ(plx_image_get_pointer(ptrs.get(), 1, 2), &target);
    Plx_Window box;
    ASSERT_TRUE(plx_image_get_active_subwindow(ptrs.get(), &box));
    EXPECT_EQ(as_vec(box), std::vector<int>({2, 1, 1, 1}));
}

TEST(ImageFill, WindowsFillOnlyTheirPixels)
{
    ImagePtr rgb = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 5, 6);
    const double a[] = {1, 2, 3}, b[] = {255.4, -1, 7.5};
    ASSERT_TRUE(plx_image_fill_const(rgb.get(), a));
    ASSERT_TRUE(plx_image_fill_const_window(rgb.get(), Plx_Window{1, 2, 4, 2}, b));
    for (int32_t r = 0; r < 5; ++r)
        for (int32_t c = 0; c < 6; ++c) {
            bool in = r >= 2 && r < 4 && c >= 1 && c < 5;
            ASSERT_EQ(pixel(rgb.get(), r, c), in ? (std::vector<double>{255, 0, 8}) : (std::vector<double>{1, 2, 3}));
        }
    // Bit windows that start and end inside words.
    for (Plx_Window w : {Plx_Window{3, 1, 40, 2}, Plx_Window{33, 0, 2, 3}, Plx_Window{0, 0, 70, 3}, Plx_Window{64, 2, 6, 1}}) {
        ImagePtr bits = random_bits(3, 70, 0.5, 17);
        const std::vector<uint8_t> before = bits_of(bits.get());
        const double one = 1;
        ASSERT_TRUE(plx_image_fill_const_window(bits.get(), w, &one));
        const std::vector<uint8_t> filled = bits_of(bits.get());
        ASSERT_TRUE(plx_image_fill_zero_window(bits.get(), w));
        const std::vector<uint8_t> cleared = bits_of(bits.get());
        for (int r = 0; r < 3; ++r) {
            EXPECT_EQ(padding(bits.get(), r), 0u);
            for (int c = 0; c < 70; ++c) {
                bool in = r >= w.y && r < w.y + w.height && c >= w.x && c < w.x + w.width;
                ASSERT_EQ(filled[r * 70 + c], in ? 1 : before[r * 70 + c]) << w.x << " " << r << "," << c;
                ASSERT_EQ(cleared[r * 70 + c], in ? 0 : before[r * 70 + c]);
            }
        }
    }
}

TEST(ImageActiveSubwindow, BoxOfPixelsWithAnyNonzeroChannel)
{
    ImagePtr im = make(PLX_FORMAT_RGB, PLX_TYPE_DOUBLE, 9, 12);
    plx_image_fill_zero(im.get());
    Plx_Window box{1, 1, 1, 1};
    ASSERT_TRUE(plx_image_get_active_subwindow(im.get(), &box));
    EXPECT_EQ(as_vec(box), std::vector<int>({0, 0, 0, 0}));
    set(im.get(), 0, 0, {0, -0.0, 0});  // -0 is zero
    set(im.get(), 2, 9, {0, 0, -2});
    set(im.get(), 7, 4, {0, 1e-300, 0});
    ASSERT_TRUE(plx_image_get_active_subwindow(im.get(), &box));
    EXPECT_EQ(as_vec(box), std::vector<int>({4, 2, 6, 6}));
}

TEST(ImagePixel, MisuseFailsWithItsCodeAndTouchesNothing)
{
    ImagePtr im = make(PLX_FORMAT_GREY_ALPHA, PLX_TYPE_FLOAT, 4, 4), bits = make(PLX_FORMAT_GREY, PLX_TYPE_BIT, 2, 70);
    ImagePtr ptrs = make(PLX_FORMAT_POINTER, PLX_TYPE_POINTER, 1, 1);
    plx_image_fill_zero(im.get());
    const std::vector<uint8_t> before = raw_bytes(im.get()), bits_before = raw_bytes(bits.get());
    const double v[] = {1, 1};
    double out[4];
    Plx_Window box;
    expect_failures({
        {[&] { return plx_image_fill_const_window(im.get(), Plx_Window{2, 2, 3, 1}, v); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_fill_zero_window(im.get(), Plx_Window{-1, 0, 1, 1}); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_fill_const(im.get(), nullptr); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_fill_zero(nullptr); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_fill_const(ptrs.get(), v); }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_set_pixel(im.get(), 0, 4, v); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_get_pixel(im.get(), -1, 0, out); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_get_pixel(ptrs.get(), 0, 0, out); }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_convert_pixel(im.get(), 0, 4, bits.get(), 0, 0); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_convert_pixel(ptrs.get(), 0, 0, bits.get(), 0, 0); }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_get_bit(bits.get(), 2, 0); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_set_bit(bits.get(), 0, 70, 1), false; }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_set_bit(im.get(), 0, 0, 1), false; }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_get_pointer(im.get(), 0, 0) != nullptr; }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_get_active_subwindow(nullptr, &box); }, PLX_ERROR_ILLEGAL_ARGUMENT},
    });
    EXPECT_EQ(raw_bytes(im.get()), before);
    EXPECT_EQ(raw_bytes(bits.get()), bits_before);
    EXPECT_TRUE(plx_image_fill_zero_window(im.get(), Plx_Window{4, 4, 0, 0}));  // empty, at the edge
}
