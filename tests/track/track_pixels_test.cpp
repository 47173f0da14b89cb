// Mask peeling and cutting, the masked 3-tap smoothing, and the pixel parameters.
#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <functional>
#include <memory>
#include <random>
#include <vector>

#include "plano/track_pixels.h"
#include "plano_host/host.h"
#include "track_test_util.hpp"

namespace {

using namespace track_test;


bool same_bits(const Plx_Image *a, const Plx_Image *b)
{
    for (int32_t r = 0; r < a->height; ++r)
        for (int32_t c = 0; c < a->width; ++c)
            if (px(a, r, c) != px(b, r, c)) return false;
    return true;
}

// ---- pgiTrackBuildMask ----

TEST(TrackBuildMask, PeelsOnlyWhereTheImagesAgree)
{
    // The images differ only in a 4 x 3 block: peeling from the mask's boundary stops there.
    auto plate = [](int32_t r, int32_t c, int k) { return double((r * 7 + c * 13 + k * 31) % 200); };
    Image a = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 14, 40, plate);
    Image b = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 14, 40, [&](int32_t r, int32_t c, int k) {
        const bool object = r >= 5 && r < 9 && c >= 33 && c < 36;
        return object && k == 1 ? plate(r, c, k) + 30 : plate(r, c, k);
    });
    Image mask = mask_of(14, 40, [](int32_t r, int32_t c) { return r >= 1 && r < 13 && c >= 2; });
    Image out(pgiTrackBuildMask(a.get(), b.get(), mask.get(), 20, nullptr));
    ASSERT_NE(out, nullptr);
    Image expected = mask_of(14, 40, [](int32_t r, int32_t c) { return r >= 5 && r < 9 && c >= 33 && c < 36; });
    EXPECT_TRUE(same_bits(out.get(), expected.get()));
    // A difference of 30 is not below a threshold of 31: the object goes too.
    Plx_Image buffer{};
    ASSERT_EQ(pgiTrackBuildMask(a.get(), b.get(), mask.get(), 31, &buffer), &buffer);
    EXPECT_EQ(buffer.type, PLX_TYPE_BIT);
    EXPECT_EQ(plx_image_bit_count(&buffer), 0u);
    plx_image_free(&buffer);
}

TEST(TrackBuildMask, IdenticalImagesPeelToNothingAndThresholdZeroKeepsTheMask)
{
    Image a = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 9, 70, [](int32_t r, int32_t c, int k) { return double(r + c + k); });
    Image mask = mask_of(9, 70, [](int32_t r, int32_t c) { return (r * c) % 5 != 3; });
    Image gone(pgiTrackBuildMask(a.get(), a.get(), mask.get(), 1, nullptr));
    ASSERT_NE(gone, nullptr);
    EXPECT_EQ(plx_image_bit_count(gone.get()), 0u);
    Image kept(pgiTrackBuildMask(a.get(), a.get(), mask.get(), 0, nullptr));
    ASSERT_NE(kept, nullptr);
    EXPECT_TRUE(same_bits(kept.get(), mask.get()));

    Image grey(plx_image_form_gen(nullptr, PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 9, 70));
    EXPECT_TRUE(fails_with(pgiTrackBuildMask(a.get(), a.get(), grey.get(), 1, nullptr), PLX_ERROR_ILLEGAL_PIXEL_TYPE));
    EXPECT_TRUE(fails_with(pgiTrackBuildMask(grey.get(), a.get(), mask.get(), 1, nullptr), PLX_ERROR_INCOMPATIBLE));
}

TEST(TrackBuildMask, OnePassRemovesOneLayer)
{
    // A thin ring of disagreement two pixels inside a solid square: the outer two layers are
    // peeled, the ring stays and shields the inside.
    auto inside_ring = [](int32_t r, int32_t c) {
        const int32_t d = std::min(std::min(r - 2, 17 - r), std::min(c - 2, 17 - c));
        return d == 2;
    };
    Image a = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 20, 20, [](int32_t, int32_t, int) { return 100.0; });
    Image b = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 20, 20,
                   [&](int32_t r, int32_t c, int) { return inside_ring(r, c) ? 180.0 : 100.0; });
    Image mask = mask_of(20, 20, [](int32_t r, int32_t c) { return r >= 2 && r < 18 && c >= 2 && c < 18; });
    Image out(pgiTrackBuildMask(a.get(), b.get(), mask.get(), 5, nullptr));
    ASSERT_NE(out, nullptr);
    Image expected = mask_of(20, 20, [](int32_t r, int32_t c) { return r >= 4 && r < 16 && c >= 4 && c < 16; });
    EXPECT_TRUE(same_bits(out.get(), expected.get()));
}

// ---- pgiTrackCombineMask ----

TEST(TrackCombineMask, CopiesMaskedPixelsOfTheWindow)
{
    Image im = make(PLX_FORMAT_RGB, PLX_TYPE_USHORT, 10, 12,
                    [](int32_t r, int32_t c, int k) { return double(1000 * k + 16 * r + c); });
    Image mask = mask_of(10, 12, [](int32_t r, int32_t c) { return (r + c) % 3 == 0; });
    Image out(pgiTrackCombineMask(im.get(), mask.get(), 2, -1, 6, 5, nullptr));
    ASSERT_NE(out, nullptr);
    EXPECT_EQ(out->format, PLX_FORMAT_RGB);
    EXPECT_EQ(out->type, PLX_TYPE_USHORT);
    ASSERT_EQ(out->height, 6);
    ASSERT_EQ(out->width, 5);
    for (int32_t r = 0; r < 6; ++r)
        for (int32_t c = 0; c < 5; ++c) {
            const int32_t sr = r + 2, sc = c - 1;
            const bool set = sc >= 0 && (sr + sc) % 3 == 0;
            for (int k = 0; k < 3; ++k)
                EXPECT_EQ(px(out.get(), r, c, k), set ? 1000.0 * k + 16 * sr + sc : 0.0) << r << "," << c;
        }
    Image empty = mask_of(10, 12, [](int32_t, int32_t) { return false; });
    Plx_Image buffer{};
    ASSERT_EQ(pgiTrackCombineMask(im.get(), empty.get(), 0, 0, 3, 4, &buffer), &buffer);
    for (int32_t r = 0; r < 3; ++r)
        for (int32_t c = 0; c < 4; ++c) EXPECT_EQ(px(&buffer, r, c, 2), 0.0);
    plx_image_free(&buffer);
    Image small = mask_of(3, 3, [](int32_t, int32_t) { return true; });
    EXPECT_TRUE(fails_with(pgiTrackCombineMask(im.get(), small.get(), 0, 0, 3, 4, nullptr), PLX_ERROR_INCOMPATIBLE));
}

// ---- pgiSmoothImage ----

// One pass computed plainly from the rules.
std::vector<double> smooth_by_hand(const std::vector<double> &in, int32_t h, int32_t w,
                                   const std::function<bool(int32_t, int32_t)> &usable)
{
    std::vector<double> out(in.size());
    auto I = [&](int32_t r, int32_t c) { return in[size_t(r) * size_t(w) + size_t(c)]; };
    for (int32_t r = 0; r < h; ++r)
        for (int32_t c = 0; c < w; ++c) {
            const bool rin = r > 0 && r < h - 1, cin = c > 0 && c < w - 1;
            const bool v = rin && usable(r - 1, c) && usable(r, c) && usable(r + 1, c);
            const bool hz = cin && usable(r, c - 1) && usable(r, c) && usable(r, c + 1);
            double o = I(r, c);
            if (v && hz) o = I(r, c) / 3 + (I(r - 1, c) + I(r + 1, c) + I(r, c - 1) + I(r, c + 1)) / 6;
            else if (v) o = (I(r - 1, c) + I(r + 1, c)) / 6 + 2 * I(r, c) / 3;
            else if (hz) o = (I(r, c - 1) + I(r, c + 1)) / 6 + 2 * I(r, c) / 3;
            out[size_t(r) * size_t(w) + size_t(c)] = o;
        }
    return out;
}

class TrackSmooth : public HostTest {};

TEST_F(TrackSmooth, PassesFollowTheMaskedRules)
{
    const int32_t h = 9, w = 37;
    Image im = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, h, w, [](int32_t r, int32_t c, int) { return double((r * 37 + c * 11) % 256); });
    auto set = [](int32_t r, int32_t c) { return (r * 5 + c * 3) % 7 != 0; };
    Image mask = mask_of(h, w, set);
    std::vector<double> plain(size_t(h * w)), masked;
    for (int32_t r = 0; r < h; ++r)
        for (int32_t c = 0; c < w; ++c) plain[size_t(r * w + c)] = px(im.get(), r, c) / 255.0;
    masked = plain;
    for (int pass = 0; pass < 3; ++pass) {
        plain = smooth_by_hand(plain, h, w, [](int32_t, int32_t) { return true; });
        masked = smooth_by_hand(masked, h, w, set);
    }
    Image a(pgiSmoothImage(im.get(), nullptr, 3, nullptr, nullptr, table()));
    Image b(pgiSmoothImage(im.get(), mask.get(), 3, nullptr, nullptr, table()));
    ASSERT_NE(a, nullptr);
    ASSERT_NE(b, nullptr);
    EXPECT_EQ(a->type, PLX_TYPE_FLOAT);
    for (int32_t r = 0; r < h; ++r)
        for (int32_t c = 0; c < w; ++c) {
            ASSERT_NEAR(px(a.get(), r, c), plain[size_t(r * w + c)], 1e-6) << r << "," << c;
            ASSERT_NEAR(px(b.get(), r, c), masked[size_t(r * w + c)], 1e-6) << r << "," << c;
        }
}

TEST_F(TrackSmooth, ZeroPassesAndOnePixelAreCopies)
{
    Image im = make(PLX_FORMAT_RGBA, PLX_TYPE_UCHAR, 3, 4, [](int32_t r, int32_t c, int k) { return double(r * 50 + c + k); });
    Image copy(pgiSmoothImage(im.get(), nullptr, 0, nullptr, nullptr, nullptr));
    ASSERT_NE(copy, nullptr);
    EXPECT_EQ(copy->format, PLX_FORMAT_RGBA);
    EXPECT_EQ(copy->type, PLX_TYPE_FLOAT);
    EXPECT_NEAR(px(copy.get(), 2, 3, 1), 104.0 / 255.0, 1e-7);
    // Passes on RGBA are refused before the buffers are touched.
    EXPECT_TRUE(fails_with(pgiSmoothImage(im.get(), nullptr, 1, nullptr, nullptr, nullptr), PLX_ERROR_UNSUPPORTED));

    Image one = make(PLX_FORMAT_GREY, PLX_TYPE_DOUBLE, 1, 1, [](int32_t, int32_t, int) { return 0.625; });
    Plx_Image result{}, second{};
    ASSERT_EQ(pgiSmoothImage(one.get(), nullptr, 5, &result, &second, table()), &result);
    EXPECT_EQ(px(&result, 0, 0), 0.625);
    plx_image_free(&result);
    plx_image_free(&second);
}

TEST_F(TrackSmooth, ColourChannelsAreSmoothedAlone)
{
    Image im = make(PLX_FORMAT_RGB, PLX_TYPE_FLOAT, 3, 3, [](int32_t r, int32_t c, int k) {
        return r == 1 && c == 1 ? (k == 0 ? 0.9 : 0.0) : 0.3 * k;
    });
    Image out(pgiSmoothImage(im.get(), nullptr, 1, nullptr, nullptr, nullptr));
    ASSERT_NE(out, nullptr);
    EXPECT_NEAR(px(out.get(), 1, 1, 0), 0.3, 1e-6);                 // 0.9 / 3
    EXPECT_NEAR(px(out.get(), 1, 1, 2), 0.6 * 4 / 6, 1e-6);          // neighbours only
    EXPECT_NEAR(px(out.get(), 0, 1, 0), 0.0, 1e-7);                  // (0 + 0) / 6 + 0
    EXPECT_NEAR(px(out.get(), 1, 0, 1), (0.3 + 0.3) / 6 + 0.2, 1e-6);  // vertical rule
    EXPECT_NEAR(px(out.get(), 0, 0, 2), 0.6, 1e-7);                  // a corner is kept
}

TEST_F(TrackSmooth, ResultIsTheSameForAnyNumberOfJobs)
{
    std::mt19937 gen(2);
    Image im = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 53, 41, [&](int32_t, int32_t, int) { return double(gen() % 1000) / 999; });
    Image mask = mask_of(53, 41, [](int32_t r, int32_t c) { return (r * c) % 4 != 1; });
    Image base(pgiSmoothImage(im.get(), mask.get(), 4, nullptr, nullptr, nullptr));
    ASSERT_NE(base, nullptr);
    for (uint32_t jobs : {1u, 2u, 5u, 80u}) {
        plano_host_set_jobs(host_, jobs);
        Image other(pgiSmoothImage(im.get(), mask.get(), 4, nullptr, nullptr, table()));
        ASSERT_NE(other, nullptr);
        for (int32_t r = 0; r < 53; ++r)
            ASSERT_EQ(0, std::memcmp(plx_image_row(base.get(), r), plx_image_row(other.get(), r), 41 * sizeof(float)))
                << "jobs " << jobs;
    }
}

// ---- pixel parameters ----

// Vertical stripes two pixels wide of the given contrast: every interior pixel has the same
// squared gradient, contrast^2.
Image stripes(double contrast)
{
    return make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 40, 40, [=](int32_t, int32_t c, int) { return (c / 2) % 2 ? contrast : 0.0; });
}

TEST(TrackPixelParameters, ThresholdAndSamplingOnStripes)
{
    Image im = stripes(255);
    double t = -1;
    uint32_t s = 99;
    // 38 x 38 interior pixels all pass t = 1; checkerboard halves them to 722 <= 800.
    ASSERT_TRUE(bTrackComputePixelParameters(im.get(), nullptr, 1.0, 0.1, 1, 0.5, 0.5, &t, &s, nullptr, nullptr, nullptr));
    EXPECT_EQ(t, 1.0);
    EXPECT_EQ(s, 1u);
    // With 10 % needed: 2 (722), 4 (19 x 19 = 361) pass, 9 (12 x 12 = 144 <= 160) fails.
    ASSERT_TRUE(bTrackComputePixelParameters(im.get(), nullptr, 1.0, 0.1, 1, 0.1, 0.5, &t, &s, nullptr, nullptr, nullptr));
    EXPECT_EQ(s, 4u);

    // A contrast of 100 is first reached at t = 0.3 (255 x 0.4 = 102 is too steep).
    Image soft = stripes(100);
    ASSERT_TRUE(bTrackComputePixelParameters(soft.get(), nullptr, 1.0, 0.1, 1, 0.5, 0.5, &t, &s, nullptr, nullptr, nullptr));
    EXPECT_NEAR(t, 0.3, 1e-9);
    // Too little contrast for any positive threshold: 0 and the sampling given.
    Image flat = stripes(0);
    ASSERT_TRUE(bTrackComputePixelParameters(flat.get(), nullptr, 1.0, 0.25, 3, 0.5, 0.5, &t, &s, nullptr, nullptr, nullptr));
    EXPECT_EQ(t, 0.0);
    EXPECT_EQ(s, 3u);
    ASSERT_TRUE(bTrackComputePixelParameters(im.get(), nullptr, 0.0, 0.1, 7, 0.5, 0.5, &t, &s, nullptr, nullptr, nullptr));
    EXPECT_EQ(t, 0.0);
    EXPECT_EQ(s, 7u);
}

TEST(TrackPixelParameters, MaskCutsTheImageAndEmptyMaskGivesDefaults)
{
    Image im = stripes(255);
    PlanoHost *host = plano_host_new(3);
    double t = -1;
    uint32_t s = 0;
    Image empty = mask_of(40, 40, [](int32_t, int32_t) { return false; });
    ASSERT_TRUE(bTrackComputePixelParameters(im.get(), empty.get(), 1.0, 0.1, 1, 0.5, 0.5, &t, &s, nullptr, nullptr,
                                             plano_host_interface(host)));
    EXPECT_EQ(t, 0.0);
    EXPECT_EQ(s, 2u);
    // A 10 x 20 masked box: its 8 x 18 interior passes, but not a checkerboard of it.
    Image box = mask_of(40, 40, [](int32_t r, int32_t c) { return r >= 5 && r < 15 && c >= 11 && c < 31; });
    Plx_Image gradient{}, selection{};
    ASSERT_TRUE(bTrackComputePixelParameters(im.get(), box.get(), 1.0, 0.1, 1, 0.5, 0.5, &t, &s, &gradient, &selection,
                                             plano_host_interface(host)));
    EXPECT_EQ(t, 1.0);
    EXPECT_EQ(s, 1u);
    EXPECT_EQ(gradient.height, 10);
    EXPECT_EQ(gradient.width, 20);
    EXPECT_EQ(gradient.type, PLX_TYPE_UINT);
    EXPECT_EQ(px(&gradient, 3, 4), 65025.0);
    EXPECT_EQ(px(&gradient, 0, 4), 0.0);  // the cut's border has no gradient
    // The selection helper on the same gradients: a grid of step 3 over rows and columns 1..8, 1..18.
    uint32_t count = 0;
    Plx_Window bounds{};
    ASSERT_TRUE(bComputeSelectedPixel(&gradient, 65025.0, 9, &selection, &count, &bounds, plano_host_interface(host)));
    EXPECT_EQ(count, 2u * 6u);
    EXPECT_EQ(bounds.x, 3);
    EXPECT_EQ(bounds.y, 3);
    EXPECT_EQ(bounds.width, 16);
    EXPECT_EQ(bounds.height, 4);
    plx_image_free(&gradient);
    plx_image_free(&selection);

    Image ints(plx_image_form_gen(nullptr, PLX_FORMAT_GREY, PLX_TYPE_INT, 5, 5));
    EXPECT_FALSE(bTrackComputePixelParameters(ints.get(), nullptr, 1, 0.1, 1, 0.5, 0.5, &t, &s, nullptr, nullptr, nullptr));
    EXPECT_EQ(origin_code(), PLX_ERROR_UNSUPPORTED);
    EXPECT_FALSE(bTrackComputePixelParameters(im.get(), nullptr, 1, 0.0, 1, 0.5, 0.5, &t, &s, nullptr, nullptr, nullptr));
    EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_ARGUMENT);
    vThreadedWorkerPoolFree();
    plano_host_free(host);
}

TEST(TrackPixelParameters, SixteenBitGradientsSaturateInsteadOfWrapping)
{
    // A full-scale 16-bit step: 65535^2 + 65535^2 exceeds 32 bits and must stay the largest.
    Image im = make(PLX_FORMAT_GREY, PLX_TYPE_USHORT, 5, 5, [](int32_t r, int32_t c, int) { return r + c >= 4 ? 65535.0 : 0.0; });
    double t = -1;
    uint32_t s = 0;
    Plx_Image gradient{};
    ASSERT_TRUE(bTrackComputePixelParameters(im.get(), nullptr, 1.0, 0.5, 1, 0.0, 0.0, &t, &s, &gradient, nullptr, nullptr));
    EXPECT_EQ(px(&gradient, 2, 2), 4294967295.0);
    EXPECT_EQ(t, 1.0);
    plx_image_free(&gradient);
}

}  // namespace
