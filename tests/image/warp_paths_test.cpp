// The warp's options against hand-computed pixels and plain references: colour correction,
// format conversion, lens distortion, the fast render, motion blur, displacement, masks and
// the background copy.
#include "warp_test_util.hpp"

namespace {

using namespace warp_test;

// A 3x3 source warped by the identity with border fill covers the whole output.
std::vector<double> corrected(Plx_ImageFormat sf, Plx_ImageFormat of, const WarpColourCorrection *cc,
                              std::vector<double> *source_pixel)
{
    Image src = make(sf, PLX_TYPE_FLOAT, 3, 3);
    fill_texture(src.get());
    Image out = make(of, PLX_TYPE_FLOAT, 3, 3);
    ProjectiveWarpParams p;
    vInitProjectiveWarpParams(&p);
    p.border_fill = 1;
    p.colour_correction = cc;
    const Plx_Matrix33 I = translation(0, 0);
    EXPECT_TRUE(warp(src.get(), out.get(), &I, &p));
    *source_pixel = pixel(src.get(), 1, 1);
    return pixel(out.get(), 1, 1);
}

TEST(ProjectiveWarpColour, CorrectionModesMatchHandComputedPixels)
{
    std::vector<double> s;
    WarpColourCorrection gain_offset{0, {2.0, 0.1}};
    auto v = corrected(PLX_FORMAT_RGBA, PLX_FORMAT_RGBA, &gain_offset, &s);
    for (int k = 0; k < 3; ++k) EXPECT_NEAR(v[k], 2.0 * s[k] + 0.1, 1e-6);
    EXPECT_EQ(v[3], s[3]);  // alpha untouched

    WarpColourCorrection mat{1, {0.5, 0.25, 0, 0, 1, 0, 0.1, 0.2, 0.3, 0.01, 0.02, 0.03}};
    v = corrected(PLX_FORMAT_BGR, PLX_FORMAT_BGR, &mat, &s);
    EXPECT_NEAR(v[0], 0.5 * s[0] + 0.25 * s[1] + 0.01, 1e-6);
    EXPECT_NEAR(v[1], s[1] + 0.02, 1e-6);
    EXPECT_NEAR(v[2], 0.1 * s[0] + 0.2 * s[1] + 0.3 * s[2] + 0.03, 1e-6);
    v = corrected(PLX_FORMAT_GREY, PLX_FORMAT_GREY, &mat, &s);
    EXPECT_EQ(v[0], s[0]);  // a colour matrix leaves grey alone

    // Gains by name: a blue-first pixel takes the red gain on its last channel.
    WarpColourCorrection gains{2, {2.0, 3.0, 4.0, 5.0}};
    v = corrected(PLX_FORMAT_BGRA, PLX_FORMAT_BGRA, &gains, &s);
    EXPECT_NEAR(v[0], 4.0 * s[0], 1e-6);
    EXPECT_NEAR(v[1], 3.0 * s[1], 1e-6);
    EXPECT_NEAR(v[2], 2.0 * s[2], 1e-6);
    EXPECT_EQ(v[3], s[3]);
    v = corrected(PLX_FORMAT_GREY_ALPHA, PLX_FORMAT_GREY_ALPHA, &gains, &s);
    EXPECT_NEAR(v[0], 5.0 * s[0], 1e-6);
    EXPECT_EQ(v[1], s[1]);

    // Across formats the correction acts in the working format (RGB here: red gain on red).
    v = corrected(PLX_FORMAT_BGR, PLX_FORMAT_RGB, &gains, &s);
    EXPECT_NEAR(v[0], 2.0 * s[2], 1e-6);
    EXPECT_NEAR(v[2], 4.0 * s[0], 1e-6);
}

TEST(ProjectiveWarpColour, FormatsAndTypesConvertOnTheWay)
{
    std::vector<double> s;
    auto v = corrected(PLX_FORMAT_RGB, PLX_FORMAT_GREY, nullptr, &s);
    EXPECT_NEAR(v[0], 0.2126 * s[0] + 0.7152 * s[1] + 0.0722 * s[2], 1e-6);
    v = corrected(PLX_FORMAT_RGB, PLX_FORMAT_BGRA, nullptr, &s);
    EXPECT_NEAR(v[0], s[2], 1e-7);
    EXPECT_NEAR(v[2], s[0], 1e-7);
    EXPECT_EQ(v[3], 1.0);
    v = corrected(PLX_FORMAT_GREY_ALPHA, PLX_FORMAT_RGBA, nullptr, &s);
    EXPECT_NEAR(v[1], s[0], 1e-7);
    EXPECT_NEAR(v[3], s[1], 1e-7);

    // Float grey into 8-bit RGB: each channel the rounded level.
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 5, 5);
    fill_texture(src.get());
    Image out = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 5, 5);
    const Plx_Matrix33 I = translation(0, 0);
    ASSERT_TRUE(warp(src.get(), out.get(), &I));
    const double g = pixel(src.get(), 2, 3)[0];
    EXPECT_EQ(pixel(out.get(), 2, 3), std::vector<double>(3, std::round(g * 255.0)));
}

// Reference of one distorted warp pixel through the double-precision camera operations.
bool reference_pixel(const Plx_Image *src, const Plx_Camera &a, const Plx_Matrix33 &H, const Plx_Camera &b, int32_t x,
                     int32_t y, double &value)
{
    const Plx_Vector3 pix{x + 0.5, y + 0.5, a.zh};
    Plx_Vector3 ray, point, out;
    if (!plx_camera_backproject_point(&a, &pix, &ray)) return false;
    plx_mat33_multv3_s(&H, &ray, &point);
    if (!plx_camera_project_point(&b, &point, &out)) return false;
    const double sx = out.x * b.zh / out.z - 0.5 - src->x, sy = out.y * b.zh / out.z - 0.5 - src->y;
    // Keep clear of the edges, where float and double positions may fall on either side.
    if (!(sx > 0.01 && sx < src->width - 1.01 && sy > 0.01 && sy < src->height - 1.01)) return false;
    value = reference_sample(src, sx, sy, 0);
    return true;
}

TEST(ProjectiveWarpDistortion, RadialAndFixedCornerCamerasMatchPointMapping)
{
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 48, 64);
    fill_texture(src.get());
    Plx_Camera radial, corner, linear;
    ASSERT_TRUE(plx_camera_build_radial_1(&radial, 1.0, 60.0, 60.0, 32.0, 24.0, 0.08));
    ASSERT_TRUE(gbCameraBuildVA(&corner, PLX_FIXED_CORNER_WARP_CAMERA, 1.0, 64.0, 48.0, 32.0, 24.0, 0.01, -0.02, 0.015,
                                0.02, -0.01, 0.01, 0.02, -0.015, 0.01, 0.0, -0.01, 0.005));
    ASSERT_TRUE(plx_camera_build_linear(&linear, 1.0, 62.0, 62.0, 32.0, 24.0));
    const Plx_Matrix33 H = matrix(1.01, 0.03, 0.02, -0.02, 0.99, -0.01, 0.01, 0.0, 1.0);
    const Plx_Camera *pairs[][2] = {{&radial, &linear}, {&linear, &corner}, {&radial, &corner}};
    for (const auto &pair : pairs) {
        Image out = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 48, 64);
        Plx_Image validity{};
        ASSERT_TRUE(warp(src.get(), out.get(), &H, nullptr, &validity, nullptr, nullptr, pair[0], pair[1]));
        int checked = 0;
        for (int32_t y = 0; y < 48; ++y)
            for (int32_t x = 0; x < 64; ++x) {
                double expect;
                if (!reference_pixel(src.get(), *pair[0], H, *pair[1], x, y, expect)) continue;
                ++checked;
                ASSERT_TRUE(bit(&validity, y, x)) << x << "," << y;
                ASSERT_NEAR(pixel(out.get(), y, x)[0], expect, 2e-3) << x << "," << y;
            }
        EXPECT_GT(checked, 1500);
        plx_image_free(&validity);
    }
}

TEST(ProjectiveWarpFastRender, TilesMatchTheBilinearPath)
{
    Image src = make(PLX_FORMAT_RGB, PLX_TYPE_FLOAT, 40, 56);
    fill_texture(src.get());
    ProjectiveWarpParams fast;
    vInitProjectiveWarpParams(&fast);
    fast.fast_render = 1;
    fast.tile_size = 8;
    // The identity is exact tile by tile.
    const Plx_Matrix33 I = translation(0, 0);
    Image a = make(PLX_FORMAT_RGB, PLX_TYPE_FLOAT, 40, 56), b = make(PLX_FORMAT_RGB, PLX_TYPE_FLOAT, 40, 56);
    ASSERT_TRUE(warp(src.get(), a.get(), &I));
    ASSERT_TRUE(warp(src.get(), b.get(), &I, &fast));
    EXPECT_TRUE(same_pixels(a.get(), b.get()));
    // A mild perspective: half-tile affine maps stay within a small fraction of a pixel.
    const Plx_Matrix33 H = matrix(1.0, 0.05, 1.5, -0.04, 1.02, 0.7, 0.0004, 0.0003, 1.0);
    Plx_Image va{}, vb{};
    ASSERT_TRUE(warp(src.get(), a.get(), &H, nullptr, &va));
    ASSERT_TRUE(warp(src.get(), b.get(), &H, &fast, &vb));
    for (int32_t y = 0; y < 40; ++y)
        for (int32_t x = 0; x < 56; ++x) {
            if (!bit(&va, y, x) || !bit(&vb, y, x)) continue;
            for (int k = 0; k < 3; ++k) ASSERT_NEAR(pixel(a.get(), y, x)[k], pixel(b.get(), y, x)[k], 2e-3);
        }
    plx_image_free(&va);
    plx_image_free(&vb);
}

TEST(ProjectiveWarpBlur, EllipseAveragesSymmetricallyAndCapsItsSamples)
{
    // A linear ramp: a symmetric blur keeps every value, while a zero first entry means none.
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 30, 30);
    for (int32_t r = 0; r < 30; ++r)
        for (int32_t c = 0; c < 30; ++c) {
            const double v = 0.01 * c + 0.02 * r;
            plx_image_set_pixel(src.get(), r, c, &v);
        }
    Image blur = make(PLX_FORMAT_VECTOR3D, PLX_TYPE_FLOAT, 30, 30);
    const double ellipse[3] = {4.0, 1.0, 2.0};
    plx_image_fill_const(blur.get(), ellipse);
    const Plx_Matrix33 H = matrix(1.1, 0.1, -1, -0.05, 0.95, 1, 0, 0, 1);
    ProjectiveWarpParams p;
    vInitProjectiveWarpParams(&p);
    p.high_quality_fill = 1;
    Image sharp = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 30, 30), soft = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 30, 30);
    ASSERT_TRUE(warp(src.get(), sharp.get(), &H, &p));
    p.blur = blur.get();
    ASSERT_TRUE(warp(src.get(), soft.get(), &H, &p));
    for (int32_t y = 8; y < 20; ++y)
        for (int32_t x = 8; x < 20; ++x) ASSERT_NEAR(pixel(soft.get(), y, x)[0], pixel(sharp.get(), y, x)[0], 2e-5);
    // Near the edge the blur reaches the zeros outside: a flat source darkens there.
    Image flat = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 30, 30);
    const double one = 1.0;
    plx_image_fill_const(flat.get(), &one);
    ASSERT_TRUE(warp(flat.get(), soft.get(), &H, &p));
    EXPECT_FLOAT_EQ(pixel(soft.get(), 15, 12)[0], 1.0f);
    EXPECT_LT(pixel(soft.get(), 15, 25)[0], 0.99);
    p.blur = nullptr;
    Image flat_sharp = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 30, 30);
    ASSERT_TRUE(warp(flat.get(), flat_sharp.get(), &H, &p));
    EXPECT_FLOAT_EQ(pixel(flat_sharp.get(), 15, 25)[0], 1.0f);
    p.blur = blur.get();

    const double none[3] = {0.0, 5.0, 9.0};
    plx_image_fill_const(blur.get(), none);
    ASSERT_TRUE(warp(src.get(), soft.get(), &H, &p));
    EXPECT_TRUE(same_pixels(soft.get(), sharp.get()));

    const double huge[3] = {1e4, 0.0, 1e4};
    plx_image_fill_const(blur.get(), huge);
    p.window_width = p.window_height = 2;
    testing::internal::CaptureStderr();
    ASSERT_TRUE(warp(src.get(), soft.get(), &H, &p));
    const std::string err = testing::internal::GetCapturedStderr();
    EXPECT_EQ(err, "Warning: Maximum number of blur samples exceeded\n");  // once per warp
}

TEST(ProjectiveWarpOptions, DisplacementActsAsAMoveOfThePixelCentres)
{
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 20, 20);
    fill_texture(src.get());
    Image field = make(PLX_FORMAT_VECTOR2D, PLX_TYPE_DOUBLE, 20, 20);
    const double d[2] = {3.0, -2.0};
    plx_image_fill_const(field.get(), d);
    ProjectiveWarpParams p;
    vInitProjectiveWarpParams(&p);
    p.displacement = field.get();
    const Plx_Matrix33 I = translation(0, 0), T = translation(3, -2);
    Image a = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 20, 20), b = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 20, 20);
    ASSERT_TRUE(warp(src.get(), a.get(), &I, &p));
    ASSERT_TRUE(warp(src.get(), b.get(), &T));
    EXPECT_TRUE(same_pixels(a.get(), b.get()));
}

TEST(ProjectiveWarpOptions, MasksRegionsAndStatistics)
{
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 10, 10, 2, 2);
    fill_texture(src.get());
    // Output mask: a 4x3 block at frame (3..6, 4..6); the warp writes nowhere else.
    Image omask = make_bits(12, 12, false, 0, 0);
    for (int32_t r = 4; r < 7; ++r)
        for (int32_t c = 3; c < 7; ++c) plx_image_set_bit(omask.get(), r, c, 1);
    plx_image_set_bit(omask.get(), 5, 5, 0);
    Image out = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 12, 12);
    const double seven = 7.0;
    plx_image_fill_const(out.get(), &seven);
    Plx_Image validity{};
    uint32_t stats = 5;
    const Plx_Matrix33 T = translation(6.0, 0.0);  // frame column 5 reads source column 11: outside
    ASSERT_TRUE(warp(src.get(), out.get(), &T, nullptr, &validity, nullptr, omask.get(), nullptr, nullptr, nullptr,
                     &stats));
    int written = 0;
    for (int32_t r = 0; r < 12; ++r)
        for (int32_t c = 0; c < 12; ++c) {
            const bool in_mask = bit(omask.get(), r, c);
            const bool sampled = in_mask && c + 4 <= 8;
            EXPECT_EQ(bit(&validity, r, c), sampled) << r << "," << c;
            if (sampled) {
                ++written;
                EXPECT_EQ(pixel(out.get(), r, c)[0], pixel(src.get(), r - 2, c + 4)[0]);
            } else {
                EXPECT_EQ(pixel(out.get(), r, c)[0], 7.0);
            }
        }
    EXPECT_EQ(written, 6);
    EXPECT_EQ(stats, 5u + 6u);
    plx_image_free(&validity);
}

TEST(ProjectiveWarpOptions, BackgroundIsCopiedAndGivesItsFrame)
{
    Image bg = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 16, 16, 5, 6);
    const double grey[3] = {10, 20, 30};
    plx_image_fill_const(bg.get(), grey);
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 6, 6, 9, 10);
    const double half = 0.5;
    plx_image_fill_const(src.get(), &half);
    Plx_Image out{};
    out.format = PLX_FORMAT_RGBA;  // the output keeps its format; the rest comes from the background
    out.type = PLX_TYPE_FLOAT;
    const Plx_Matrix33 I = translation(0, 0);
    ASSERT_TRUE(bImageProjectiveWarp(bg.get(), nullptr, nullptr, src.get(), nullptr, nullptr, &I, nullptr, &out,
                                     nullptr, nullptr, nullptr, 1));
    ASSERT_EQ(out.width, 16);
    EXPECT_EQ(out.x, 5);
    EXPECT_EQ(out.y, 6);
    EXPECT_NEAR(pixel(&out, 0, 0)[1], 20.0 / 255.0, 1e-6);
    EXPECT_EQ(pixel(&out, 0, 0)[3], 1.0);
    // Source frame (9..14, 10..15) is output-local (4..9, 4..9); its last row and column
    // keep the background.
    EXPECT_EQ(pixel(&out, 4, 4)[0], 0.5);
    EXPECT_EQ(pixel(&out, 8, 8)[2], 0.5);
    EXPECT_NEAR(pixel(&out, 9, 9)[2], 30.0 / 255.0, 1e-6);
    plx_image_free(&out);
}

}  // namespace

// 8-bit and one-channel float sources are blended eight pixels at a time where the machine
// allows; a source mask (all set) sends every pixel through the one-at-a-time loop, which must
// give the same bits, and both must match a plain bilinear sample to within rounding.
TEST(ProjectiveWarpBilinear, VectorRunsMatchPixelByPixelAndReference)
{
    const double a = 0.3, s = 0.93;
    const Plx_Matrix33 H = matrix(s * std::cos(a), -s * std::sin(a), 20.0, s * std::sin(a), s * std::cos(a), -6.0,
                                  1e-4, -2e-4, 1.0);
    const std::pair<Plx_ImageFormat, Plx_PixelType> cases[] = {
        {PLX_FORMAT_GREY, PLX_TYPE_UCHAR}, {PLX_FORMAT_RGB, PLX_TYPE_UCHAR}, {PLX_FORMAT_RGBA, PLX_TYPE_UCHAR},
        {PLX_FORMAT_BGR, PLX_TYPE_UCHAR},  {PLX_FORMAT_GREY, PLX_TYPE_FLOAT}};
    for (auto [f, t] : cases) {
        Image src = make(f, t, 61, 83);
        fill_texture(src.get());
        Image mask = make_bits(61, 83, true);
        Image plain = make(f, t, 61, 83), masked = make(f, t, 61, 83);
        plx_image_fill_zero(plain.get());
        plx_image_fill_zero(masked.get());
        ASSERT_TRUE(warp(src.get(), plain.get(), &H));
        ASSERT_TRUE(warp(src.get(), masked.get(), &H, nullptr, nullptr, mask.get()));
        EXPECT_TRUE(same_pixels(plain.get(), masked.get())) << "format " << f;
        int checked = 0;
        const int channels = int(plx_image_format_channels(f));
        for (int32_t y = 0; y < 61; ++y)
            for (int32_t x = 0; x < 83; ++x) {
                const double X = x + 0.5, Y = y + 0.5, w = H.m[2][0] * X + H.m[2][1] * Y + H.m[2][2];
                const double sx = (H.m[0][0] * X + H.m[0][1] * Y + H.m[0][2]) / w - 0.5;
                const double sy = (H.m[1][0] * X + H.m[1][1] * Y + H.m[1][2]) / w - 0.5;
                if (!(sx > 0.01 && sx < 83 - 1.01 && sy > 0.01 && sy < 61 - 1.01)) continue;
                ++checked;
                for (int c = 0; c < channels; ++c) {
                    const double want = reference_sample(src.get(), sx, sy, c);
                    if (t == PLX_TYPE_UCHAR)
                        ASSERT_NEAR(pixel(plain.get(), y, x)[c], std::round(want), 1.0) << f << " " << x << "," << y;
                    else
                        ASSERT_NEAR(pixel(plain.get(), y, x)[c], want, 2e-3 * full_scale(t)) << x << "," << y;
                }
            }
        EXPECT_GT(checked, 2500);
    }
}
