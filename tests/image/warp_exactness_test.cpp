// Known answers of the projective warp: copies, integer moves, round trips, the border rules
// and the high-quality edge ramp.
#include "warp_test_util.hpp"

namespace {

using namespace warp_test;

struct FormatType {
    Plx_ImageFormat format;
    Plx_PixelType type;
};

TEST(ProjectiveWarpExact, IdentityBetweenEqualCamerasCopiesEveryFormatAndType)
{
    const FormatType cases[] = {{PLX_FORMAT_GREY, PLX_TYPE_UCHAR},  {PLX_FORMAT_GREY_ALPHA, PLX_TYPE_UCHAR},
                                {PLX_FORMAT_RGB, PLX_TYPE_UCHAR},   {PLX_FORMAT_RGBA, PLX_TYPE_USHORT},
                                {PLX_FORMAT_BGR, PLX_TYPE_FLOAT},   {PLX_FORMAT_BGRA, PLX_TYPE_DOUBLE},
                                {PLX_FORMAT_GREY, PLX_TYPE_INT},    {PLX_FORMAT_RGB, PLX_TYPE_UINT},
                                {PLX_FORMAT_GREY, PLX_TYPE_USHORT}, {PLX_FORMAT_GREY, PLX_TYPE_BIT}};
    Plx_Camera cam;
    ASSERT_TRUE(plx_camera_build_linear(&cam, 1.0, 120.0, 110.0, 20.0, 15.0));
    const Plx_Matrix33 H = matrix(2, 0, 0, 0, 2, 0, 0, 0, 2);  // a multiple of the identity
    for (const auto &fc : cases) {
        SCOPED_TRACE(testing::Message() << "format " << fc.format << " type " << fc.type);
        Image src = make(fc.format, fc.type, 23, 37, 4, -3);
        fill_texture(src.get());
        Image out = make(fc.format, fc.type, 23, 37, 4, -3);
        ProjectiveWarpParams p;
        vInitProjectiveWarpParams(&p);
        p.border_fill = 1;  // lets the last row and column take their own pixel
        Plx_Image validity{};
        ASSERT_TRUE(warp(src.get(), out.get(), &H, &p, &validity, nullptr, nullptr, &cam, &cam));
        if (fc.type != PLX_TYPE_DOUBLE) {
            EXPECT_TRUE(same_pixels(src.get(), out.get()));
        } else {
            // Pixels pass through single precision between reading and writing.
            for (int32_t r = 0; r < 23; ++r)
                for (int32_t c = 0; c < 37; ++c)
                    for (int k = 0; k < 4; ++k)
                        ASSERT_NEAR(pixel(out.get(), r, c)[k], pixel(src.get(), r, c)[k], 1e-7);
        }
        // The last row and column are filled from the nearest pixel, so they are not valid
        // bilinear samples; everything else is.
        EXPECT_TRUE(bit(&validity, 5, 5));
        EXPECT_FALSE(bit(&validity, 22, 5));
        EXPECT_FALSE(bit(&validity, 5, 36));
        plx_image_free(&validity);
    }
}

TEST(ProjectiveWarpExact, IntegerTranslationMovesPixelsExactly)
{
    Image src = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 30, 40);
    fill_texture(src.get());
    Image out = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 30, 40);
    // Output pixel (x, y) takes source pixel (x + 3, y - 2); the same map written with a
    // common scale of 2 must give the same bits.
    const Plx_Matrix33 Hs[] = {translation(3, -2), matrix(2, 0, 6, 0, 2, -4, 0, 0, 2)};
    for (const auto &H : Hs) {
        Image src_f = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 30, 40);
        fill_texture(src_f.get());
        Image out_f = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 30, 40);
        ASSERT_TRUE(warp(src.get(), out.get(), &H));
        ASSERT_TRUE(warp(src_f.get(), out_f.get(), &H));
        for (int32_t r = 2; r < 29; ++r)
            for (int32_t c = 0; c < 36; ++c) {
                ASSERT_EQ(pixel(out.get(), r, c), pixel(src.get(), r - 2, c + 3)) << r << "," << c;
                ASSERT_EQ(pixel(out_f.get(), r, c), pixel(src_f.get(), r - 2, c + 3)) << r << "," << c;
            }
    }
}

TEST(ProjectiveWarpExact, WarpThenInverseReturnsTheInterior)
{
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 64, 80);
    fill_texture(src.get());
    Plx_Camera cam;
    ASSERT_TRUE(plx_camera_build_linear(&cam, 1.0, 90.0, 90.0, 40.0, 32.0));
    // A mild rotation, scale and perspective in normalised coordinates.
    const Plx_Matrix33 H = matrix(0.98, -0.12, 0.03, 0.11, 1.02, -0.02, 0.04, -0.03, 1.0);
    Plx_Matrix33 Hinv;
    ASSERT_TRUE(plx_mat33_invert_s(&H, &Hinv));
    Image mid = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 64, 80);
    Image back = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 64, 80);
    Plx_Image v1{}, v2{};
    ASSERT_TRUE(warp(src.get(), mid.get(), &H, nullptr, &v1, nullptr, nullptr, &cam, &cam));
    ASSERT_TRUE(warp(mid.get(), back.get(), &Hinv, nullptr, &v2, &v1, nullptr, &cam, &cam));
    int checked = 0;
    for (int32_t r = 8; r < 56; ++r)
        for (int32_t c = 8; c < 72; ++c) {
            if (!bit(&v2, r, c)) continue;
            ++checked;
            // Two bilinear resamplings of a texture with curvature below 0.06 per pixel^2.
            ASSERT_NEAR(pixel(back.get(), r, c)[0], pixel(src.get(), r, c)[0], 0.03) << r << "," << c;
        }
    EXPECT_GT(checked, 2000);
    plx_image_free(&v1);
    plx_image_free(&v2);
}

TEST(ProjectiveWarpExact, LastRowAndColumnFollowTheBorderRules)
{
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 4, 4);
    fill_texture(src.get());
    const Plx_Matrix33 I = translation(0, 0);
    {
        // Plain bilinear: the last column and row cannot be sampled and stay as they were.
        Image out = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 4, 4);
        const double seven = 7.0;
        plx_image_fill_const(out.get(), &seven);
        Plx_Image validity{};
        ASSERT_TRUE(warp(src.get(), out.get(), &I, nullptr, &validity));
        EXPECT_EQ(pixel(out.get(), 1, 3)[0], 7.0);
        EXPECT_EQ(pixel(out.get(), 3, 1)[0], 7.0);
        EXPECT_FALSE(bit(&validity, 1, 3));
        EXPECT_EQ(pixel(out.get(), 2, 2)[0], pixel(src.get(), 2, 2)[0]);
        EXPECT_TRUE(bit(&validity, 2, 2));
        plx_image_free(&validity);
    }
    {
        // A window image lets only its own pixels be taken as nearest pixels.
        Image out = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 4, 4);
        Image win = make_bits(4, 4, true);
        plx_image_set_bit(win.get(), 3, 1, 0);
        ProjectiveWarpParams p;
        vInitProjectiveWarpParams(&p);
        p.window_image = win.get();
        Plx_Image validity{};
        ASSERT_TRUE(warp(src.get(), out.get(), &I, &p, &validity));
        EXPECT_EQ(pixel(out.get(), 1, 3)[0], pixel(src.get(), 1, 3)[0]);
        EXPECT_EQ(pixel(out.get(), 3, 1)[0], 0.0);
        EXPECT_FALSE(bit(&validity, 1, 3));
        plx_image_free(&validity);
    }
    {
        // Border fill takes the nearest pixel only where the source mask allows it.
        Image out = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 4, 4);
        Image mask = make_bits(4, 4, true);
        plx_image_set_bit(mask.get(), 3, 2, 0);
        ProjectiveWarpParams p;
        vInitProjectiveWarpParams(&p);
        p.border_fill = 1;
        ASSERT_TRUE(warp(src.get(), out.get(), &I, &p, nullptr, mask.get()));
        EXPECT_EQ(pixel(out.get(), 3, 1)[0], pixel(src.get(), 3, 1)[0]);
        EXPECT_EQ(pixel(out.get(), 3, 2)[0], 0.0);
        // (1, 2)'s neighbourhood spans rows 1 and 2 only: a plain bilinear sample.
        EXPECT_EQ(pixel(out.get(), 1, 2)[0], pixel(src.get(), 1, 2)[0]);
        // (2, 2)'s neighbourhood includes the cleared (3, 2): nearest pixel (2, 2) is set.
        EXPECT_EQ(pixel(out.get(), 2, 2)[0], pixel(src.get(), 2, 2)[0]);
    }
}

TEST(ProjectiveWarpExact, HighQualityEdgesRampOverOnePixel)
{
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 8, 8, 2, 0);
    const double one = 1.0;
    plx_image_fill_const(src.get(), &one);
    // Output pixel x samples source frame x - 0.5 + 0.5: half a pixel left of its centre.
    const Plx_Matrix33 H = translation(-0.5, 0.0);
    ProjectiveWarpParams p;
    vInitProjectiveWarpParams(&p);
    p.high_quality_fill = 1;
    Image out = make(PLX_FORMAT_GREY_ALPHA, PLX_TYPE_FLOAT, 8, 14);
    const double keep[2] = {9.0, 9.0};
    plx_image_fill_const(out.get(), keep);
    Plx_Image validity{};
    ASSERT_TRUE(warp(src.get(), out.get(), &H, &p, &validity));
    // Frame columns 2..10 see the source (frame 2..9), with a half-covered pixel at each end;
    // alpha is the coverage, since the grey source has no alpha of its own.
    const double expect[14] = {9, 9, 0.5, 1, 1, 1, 1, 1, 1, 1, 0.5, 9, 9, 9};
    for (int32_t c = 0; c < 14; ++c) {
        EXPECT_DOUBLE_EQ(pixel(out.get(), 4, c)[0], expect[c]) << c;
        EXPECT_DOUBLE_EQ(pixel(out.get(), 4, c)[1], expect[c]) << c;
        EXPECT_EQ(bit(&validity, 4, c), expect[c] != 9) << c;
    }
    // The plain bilinear path ends hard at the same edges.
    Image hard = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 8, 14);
    ASSERT_TRUE(warp(src.get(), hard.get(), &H));
    EXPECT_EQ(pixel(hard.get(), 4, 2)[0], 0.0);
    EXPECT_EQ(pixel(hard.get(), 4, 3)[0], 1.0);
    EXPECT_EQ(pixel(hard.get(), 4, 9)[0], 1.0);
    EXPECT_EQ(pixel(hard.get(), 4, 10)[0], 0.0);
    plx_image_free(&validity);
}

TEST(ProjectiveWarpExact, AlphaWeightingScalesColourByCoverage)
{
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 6, 6);
    const double one = 1.0;
    plx_image_fill_const(src.get(), &one);
    // Output column 0 covers three quarters of a pixel: alpha 0.75.
    const Plx_Matrix33 H = translation(-0.25, 0.0);
    struct Case {
        uint32_t inverse, divide;
        double colour;
    } cases[] = {{0, 0, 0.75 * 0.75}, {1, 0, 0.75 * 0.25}, {1, 1, 0.75 * (0.25 / 0.75)}, {0, 1, 0.75}};
    for (const auto &k : cases) {
        ProjectiveWarpParams p;
        vInitProjectiveWarpParams(&p);
        p.high_quality_fill = 1;
        p.alpha_weighting = 1;
        p.inverse_alpha = k.inverse;
        p.divide_by_alpha = k.divide;
        Image out = make(PLX_FORMAT_RGBA, PLX_TYPE_FLOAT, 6, 6);
        ASSERT_TRUE(warp(src.get(), out.get(), &H, &p));
        const auto v = pixel(out.get(), 2, 0);
        EXPECT_NEAR(v[0], k.colour, 1e-6);
        EXPECT_NEAR(v[2], k.colour, 1e-6);
        EXPECT_NEAR(v[3], 0.75, 1e-6);
    }
}

}  // namespace
