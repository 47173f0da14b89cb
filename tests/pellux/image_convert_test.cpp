// Conversion between pixel types and formats: hand-computed values, BGR order, windows at
// offsets, channel extraction, and refusals that leave the destination as it was.
#include <cmath>
#include <limits>

#include "image_test_util.hpp"

using namespace plx_test;

namespace {

// A one-pixel image of format f and type t holding v, converted, read back.
std::vector<double> convert(Plx_ImageFormat sf, Plx_PixelType st, std::vector<double> v, Plx_ImageFormat df,
                            Plx_PixelType dt)
{
    ImagePtr s = make(sf, st, 1, 1);
    set(s.get(), 0, 0, v);
    ImagePtr d(plx_image_convert_q(s.get(), df, dt, nullptr));
    return d ? pixel(d.get(), 0, 0) : std::vector<double>{};
}

}  // namespace

TEST(ImageConvert, TypesRescaleRoundAndClamp)
{
    const double nan = std::numeric_limits<double>::quiet_NaN();
    const struct {
        Plx_PixelType st;
        double v;
        Plx_PixelType dt;
        double want;
    } cases[] = {
        {PLX_TYPE_UCHAR, 128, PLX_TYPE_USHORT, 32896}, {PLX_TYPE_USHORT, 128, PLX_TYPE_UCHAR, 0},  // 0.498
        {PLX_TYPE_USHORT, 129, PLX_TYPE_UCHAR, 1},      {PLX_TYPE_UCHAR, 51, PLX_TYPE_DOUBLE, 0.2},
        {PLX_TYPE_DOUBLE, 0.5, PLX_TYPE_UCHAR, 128},    {PLX_TYPE_DOUBLE, -0.1, PLX_TYPE_UCHAR, 0},
        {PLX_TYPE_DOUBLE, 1.2, PLX_TYPE_USHORT, 65535}, {PLX_TYPE_DOUBLE, nan, PLX_TYPE_UCHAR, 0},
        {PLX_TYPE_DOUBLE, -2.5, PLX_TYPE_INT, -3},      {PLX_TYPE_DOUBLE, 1e10, PLX_TYPE_INT, 2147483647},
        {PLX_TYPE_INT, -7, PLX_TYPE_UINT, 0},           {PLX_TYPE_INT, 300, PLX_TYPE_UCHAR, 255},
        {PLX_TYPE_INT, 200, PLX_TYPE_UCHAR, 200},       {PLX_TYPE_UINT, 4e9, PLX_TYPE_DOUBLE, 4e9},
        {PLX_TYPE_BIT, 1, PLX_TYPE_UCHAR, 255},         {PLX_TYPE_BIT, 1, PLX_TYPE_INT, 1},
        {PLX_TYPE_UCHAR, 127, PLX_TYPE_BIT, 0},         {PLX_TYPE_UCHAR, 128, PLX_TYPE_BIT, 1},
    };
    for (const auto &c : cases)
        EXPECT_EQ(convert(PLX_FORMAT_GREY, c.st, {c.v}, PLX_FORMAT_GREY, c.dt), std::vector<double>{c.want})
            << "type " << c.st << " value " << c.v << " to type " << c.dt;
}

TEST(ImageConvert, FormatsUseLuminanceRepetitionFullAlphaAndBgrOrder)
{
    const auto G = PLX_FORMAT_GREY, GA = PLX_FORMAT_GREY_ALPHA, RGB = PLX_FORMAT_RGB, RGBA = PLX_FORMAT_RGBA,
               BGR = PLX_FORMAT_BGR, BGRA = PLX_FORMAT_BGRA;
    const auto UC = PLX_TYPE_UCHAR;
    // 0.2126 * 200 + 0.7152 * 100 + 0.0722 * 50 = 117.65
    EXPECT_EQ(convert(RGB, UC, {200, 100, 50}, G, UC), std::vector<double>{118});
    EXPECT_EQ(convert(BGRA, UC, {50, 100, 200, 20}, G, UC), std::vector<double>{118});
    EXPECT_EQ(convert(BGRA, UC, {50, 100, 200, 20}, GA, UC), (std::vector<double>{118, 20}));
    EXPECT_EQ(convert(RGB, UC, {200, 100, 50}, BGR, UC), (std::vector<double>{50, 100, 200}));
    EXPECT_EQ(convert(BGRA, UC, {50, 100, 200, 20}, RGBA, PLX_TYPE_USHORT),
              (std::vector<double>{200 * 257, 100 * 257, 50 * 257, 20 * 257}));
    EXPECT_EQ(convert(GA, UC, {10, 20}, BGRA, UC), (std::vector<double>{10, 10, 10, 20}));
    EXPECT_EQ(convert(RGB, UC, {255, 0, 51}, RGBA, PLX_TYPE_DOUBLE), (std::vector<double>{1, 0, 0.2, 1}));
    EXPECT_EQ(convert(G, PLX_TYPE_INT, {77}, GA, PLX_TYPE_INT), (std::vector<double>{77, 1}));  // int full scale
    EXPECT_EQ(convert(PLX_FORMAT_VECTOR2D, PLX_TYPE_FLOAT, {-3.5, 12.25}, PLX_FORMAT_VECTOR3D, PLX_TYPE_DOUBLE),
              (std::vector<double>{-3.5, 12.25, 0}));

    // Channels are numbered in storage order; colour to grey only from colour.
    ImagePtr bgr = make(BGR, UC, 2, 3);
    const double v[] = {10, 20, 30};
    plx_image_fill_const(bgr.get(), v);
    bgr->x = 4;
    ImagePtr blue(plx_image_extract_channel_q(bgr.get(), 0, PLX_TYPE_NONE, nullptr));
    EXPECT_EQ(pixel(blue.get(), 1, 2), std::vector<double>{10});
    EXPECT_EQ(blue->x, 4);
    ImagePtr red(plx_image_extract_channel_q(bgr.get(), 2, PLX_TYPE_USHORT, nullptr));
    EXPECT_EQ(pixel(red.get(), 0, 0), std::vector<double>{30 * 257});
    ImagePtr grey(plx_image_colour_to_grey_q(bgr.get(), PLX_TYPE_NONE, nullptr));
    EXPECT_EQ(pixel(grey.get(), 0, 0)[0], std::round(plx_rgb_to_luminance(30, 20, 10)));
    EXPECT_EQ(lookup_table_8bit[0], 0.0f);
    EXPECT_EQ(lookup_table_8bit[51], 0.2f);
    EXPECT_EQ(lookup_table_8bit[255], 1.0f);
}

TEST(ImageConvert, WindowOfAViewMatchesPixelByPixelConversion)
{
    // Wider than the converter's scratch chunk, from an offset window of an offset view.
    ImagePtr src = make(PLX_FORMAT_BGR, PLX_TYPE_USHORT, 5, 700);
    std::mt19937 rng(3);
    for (int32_t r = 0; r < 5; ++r)
        for (int32_t c = 0; c < 700; ++c) set(src.get(), r, c, {double(rng() % 65536), double(rng() % 65536), double(rng() % 65536)});
    src->x = 1000;
    Plx_Image view{};
    ASSERT_NE(plx_image_extract_q(src.get(), Plx_Window{3, 1, 650, 4}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &view), nullptr);
    ImagePtr out(plx_image_extract_q(&view, Plx_Window{7, 1, 600, 3}, PLX_FORMAT_RGBA, PLX_TYPE_UCHAR, 1, nullptr));
    ASSERT_NE(out, nullptr);
    EXPECT_EQ(out->x, 1010);
    EXPECT_EQ(out->y, 2);
    ImagePtr one = make(PLX_FORMAT_RGBA, PLX_TYPE_UCHAR, 1, 1);
    for (int32_t r = 0; r < 3; ++r)
        for (int32_t c = 0; c < 600; ++c) {
            std::vector<double> s = pixel(src.get(), r + 2, c + 10);
            std::vector<double> want = {std::round(s[2] / 257), std::round(s[1] / 257), std::round(s[0] / 257), 255};
            ASSERT_EQ(pixel(out.get(), r, c), want) << r << "," << c;
            ASSERT_TRUE(plx_image_convert_pixel(src.get(), r + 2, c + 10, one.get(), 0, 0));
            ASSERT_EQ(pixel(one.get(), 0, 0), want);
        }
    plx_image_free(&view);

    // Bit windows at any column: copied across word boundaries, padding left zero.
    ImagePtr bits = random_bits(6, 97, 0.5, 11);
    for (int32_t x : {0, 5, 31, 40}) {
        ImagePtr cut(plx_image_extract_q(bits.get(), Plx_Window{x, 2, 96 - x, 3}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 1, nullptr));
        ASSERT_NE(cut, nullptr);
        for (int32_t r = 0; r < 3; ++r) {
            EXPECT_EQ(padding(cut.get(), r), 0u);
            for (int32_t c = 0; c < cut->width; ++c)
                ASSERT_EQ(plx_image_get_bit(cut.get(), r, c), plx_image_get_bit(bits.get(), r + 2, c + x)) << x;
        }
    }
}

TEST(ImageConvert, RefusalsLeaveTheDestinationAsItWas)
{
    ImagePtr field = make(PLX_FORMAT_VECTOR2D, PLX_TYPE_FLOAT, 3, 4), ptrs = make(PLX_FORMAT_POINTER, PLX_TYPE_POINTER, 3, 4);
    ImagePtr dest = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 2, 2), small = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 3, 3);
    plx_image_fill_zero(field.get());
    const double v[] = {1, 2, 3};
    plx_image_fill_const(dest.get(), v);
    ImagePtr big = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 4, 4);
    plx_image_fill_zero(big.get());
    Plx_Image view{};
    ASSERT_NE(plx_image_extract_q(big.get(), Plx_Window{1, 1, 2, 2}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &view), nullptr);
    const Plx_Image dest_record = *dest, view_record = view;
    const std::vector<uint8_t> dest_pixels = raw_bytes(dest.get()), big_pixels = raw_bytes(big.get());

    const Plx_Window w{0, 0, 2, 2};
    const Plx_ImageFormat G = PLX_FORMAT_GREY, NF = PLX_FORMAT_NONE;
    expect_failures({
        {[&] { return plx_image_convert_q(field.get(), PLX_FORMAT_RGB, PLX_TYPE_NONE, dest.get()); }, PLX_ERROR_ILLEGAL_FORMAT},
        {[&] { return plx_image_extract_q(field.get(), w, G, PLX_TYPE_NONE, 1, dest.get()); }, PLX_ERROR_ILLEGAL_FORMAT},
        {[&] { return plx_image_colour_to_grey_q(big.get(), PLX_TYPE_NONE, dest.get()); }, PLX_ERROR_ILLEGAL_FORMAT},
        {[&] { return plx_image_convert_q(ptrs.get(), G, PLX_TYPE_UCHAR, dest.get()); }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_extract_channel_q(ptrs.get(), 0, PLX_TYPE_NONE, dest.get()); }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_convert_q(field.get(), NF, PLX_TYPE_BIT, dest.get()); }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_extract_channel_q(small.get(), 3, PLX_TYPE_NONE, dest.get()); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_convert_q(nullptr, PLX_FORMAT_RGB, PLX_TYPE_NONE, dest.get()); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_convert_q(dest.get(), G, PLX_TYPE_NONE, dest.get()); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_convert_q(small.get(), G, PLX_TYPE_NONE, &view); }, PLX_ERROR_INCOMPATIBLE},
    });
    EXPECT_EQ(std::memcmp(&dest_record, dest.get(), sizeof dest_record), 0);
    EXPECT_EQ(std::memcmp(&view_record, &view, sizeof view), 0);
    EXPECT_EQ(raw_bytes(dest.get()), dest_pixels);
    EXPECT_EQ(raw_bytes(big.get()), big_pixels);
    // A view takes a result of its own shape in place.
    EXPECT_EQ(plx_image_convert_q(dest.get(), PLX_FORMAT_GREY, PLX_TYPE_NONE, &view), &view);
    EXPECT_EQ(pixel(big.get(), 2, 2)[0], 2.0);  // luminance 1.86
    EXPECT_EQ(pixel(big.get(), 3, 3)[0], 0.0);
    plx_image_free(&view);
}

TEST(ImageConvert, ExtractionIntoHeapRecordsKeepsThemOwned)
{
    // A heap view record re-targeted, then turned into a copy, must stay freeable exactly once
    // (the sanitizer build reports the leak or double free otherwise).
    ImagePtr im = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 8, 8);
    plx_image_fill_zero(im.get());
    Plx_Image *v = plx_image_extract_q(im.get(), Plx_Window{0, 0, 4, 4}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, nullptr);
    ASSERT_EQ(plx_image_extract_q(im.get(), Plx_Window{2, 2, 4, 4}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, v), v);
    ASSERT_EQ(plx_image_extract_q(im.get(), Plx_Window{1, 1, 3, 3}, PLX_FORMAT_NONE, PLX_TYPE_UCHAR, 1, v), v);
    EXPECT_EQ(v->owned, 1u);
    plx_image_free(v);
    // Nor may a copy go into the image whose pixels it reads.
    Plx_Image part{};
    ASSERT_NE(plx_image_extract_q(im.get(), Plx_Window{1, 1, 3, 3}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &part), nullptr);
    EXPECT_FALSE(plx_image_extract_q(&part, Plx_Window{0, 0, 2, 2}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 1, im.get()));
    EXPECT_EQ(last_code(), PLX_ERROR_INCOMPATIBLE);
    EXPECT_EQ(im->width, 8);
    plx_image_free(&part);
}
