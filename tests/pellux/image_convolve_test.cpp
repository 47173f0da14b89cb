// 1D convolution against a plain reference, and Gaussian masks.
#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <random>
#include <cstring>
#include <vector>

#include "common/reference_convolve.hpp"
#include "convolve_kernels.hpp"
#include "pellux/detail/pixel_traits.hpp"
#include "failure_check.hpp"
#include "pellux/pellux.h"

namespace {

using plano_test::fails_with;

struct Shape {
    Plx_ImageFormat format;
    int height, width;
};

// Convolves a noise image (or a view of one, with offsets and a padded stride) and compares
// every value with the reference; with views, the pixels around dest's view must stay put.
template <class T>
void expect_matches_reference(Shape shape, int channel, Plx_EdgeBehaviour edge, const std::vector<double> &taps,
                              bool along_y, bool views, Plx_PixelType mask_type = PLX_TYPE_DOUBLE)
{
    const Plx_PixelType type = plx::PixelTraits<T>::code;
    const int pad = views ? 3 : 0;
    Plx_Image *src_parent = plx_image_form_gen(nullptr, shape.format, type, shape.height + 2 * pad, shape.width + 2 * pad + 1);
    Plx_Image *dst_parent = plx_image_form_gen(nullptr, shape.format, type, shape.height + pad, shape.width + 2 * pad);
    ASSERT_TRUE(src_parent && dst_parent);
    reference::fill_noise<T>(src_parent, 1);
    reference::fill_noise<T>(dst_parent, 2);
    Plx_Image src{}, dst{};
    ASSERT_TRUE(plx_image_extract_q(src_parent, {pad + 1, pad, shape.width, shape.height}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &src));
    ASSERT_TRUE(plx_image_extract_q(dst_parent, {pad, pad, shape.width, shape.height}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &dst));
    Plx_Image *before = plx_image_copy_q(dst_parent, nullptr);
    ASSERT_NE(before, nullptr);

    std::vector<float> ftaps(taps.begin(), taps.end());
    std::vector<double> dtaps(taps);
    if (mask_type == PLX_TYPE_FLOAT) dtaps.assign(ftaps.begin(), ftaps.end());  // what the library sees
    const std::vector<double> expected = reference::convolve<T>(&src, &dst, channel, edge, dtaps, along_y);
    Plx_Mask1D mask{mask_type, uint32_t(taps.size()),
                    mask_type == PLX_TYPE_FLOAT ? static_cast<void *>(ftaps.data()) : static_cast<void *>(dtaps.data())};
    ASSERT_TRUE(along_y ? plx_image_convolve1Dy_q(&src, channel, edge, &mask, &dst)
                        : plx_image_convolve1Dx_q(&src, channel, edge, &mask, &dst));

    const int channels = int(plx_image_format_channels(shape.format));
    const double tolerance = std::is_same_v<T, float> ? 1e-5 : std::is_same_v<T, double> ? 1e-12 : 1.0;
    int bad = 0;
    for (int y = 0; y < shape.height; ++y)
        for (int x = 0; x < shape.width; ++x)
            for (int ch = 0; ch < channels; ++ch) {
                const double want = double(reference::to_type<T>(expected[(y * shape.width + x) * channels + ch]));
                const double got = double(*reference::at<T>(&dst, y, x, ch));
                const double scale = std::is_floating_point_v<T> ? 1.0 + std::fabs(want) : 1.0;
                if (std::fabs(got - want) > tolerance * scale && ++bad <= 3)
                    ADD_FAILURE() << "type " << type << " edge " << edge << (along_y ? " y" : " x") << " at (" << y
                                  << ", " << x << ", " << ch << "): " << got << " != " << want;
            }
    for (int y = 0; y < dst_parent->height; ++y)
        for (int x = 0; x < dst_parent->width; ++x) {
            const bool inside = y >= pad && y < pad + shape.height && x >= pad && x < pad + shape.width;
            for (int ch = 0; ch < channels && !inside; ++ch)
                ASSERT_EQ(*reference::at<T>(dst_parent, y, x, ch), *reference::at<T>(before, y, x, ch));
        }
    plx_image_free(before);
    plx_image_free(&src);
    plx_image_free(&dst);
    plx_image_free(src_parent);
    plx_image_free(dst_parent);
}

template <class T>
void every_edge_and_direction(Shape shape, const std::vector<double> &taps, bool views)
{
    for (Plx_EdgeBehaviour edge : {PLX_EDGE_ZERO, PLX_EDGE_EXTEND, PLX_EDGE_REFLECT})
        for (bool along_y : {false, true}) expect_matches_reference<T>(shape, -1, edge, taps, along_y, views);
}

const std::vector<double> kLopsided = {0.1, -0.2, 0.5, 0.35, 0.25};  // catches a flipped mask

}  // namespace

// Every type, several formats, both masks, edges and directions; the last rows on views with
// offsets and padded strides; then one channel of several, which must leave the others alone.
TEST(Convolve1D, MatchesPlainConvolutionForEveryTypeFormatEdgeAndView)
{
    const std::vector<double> gauss = reference::gaussian(1.3);
    every_edge_and_direction<uint8_t>({PLX_FORMAT_RGB, 9, 13}, kLopsided, false);
    every_edge_and_direction<uint8_t>({PLX_FORMAT_GREY, 11, 37}, gauss, false);
    every_edge_and_direction<uint16_t>({PLX_FORMAT_GREY_ALPHA, 7, 11}, gauss, false);
    every_edge_and_direction<int32_t>({PLX_FORMAT_RGBA, 6, 9}, kLopsided, false);
    every_edge_and_direction<uint32_t>({PLX_FORMAT_VECTOR2D, 8, 5}, gauss, false);
    every_edge_and_direction<float>({PLX_FORMAT_RGB, 10, 23}, gauss, false);
    every_edge_and_direction<float>({PLX_FORMAT_GREY, 5, 41}, kLopsided, false);
    every_edge_and_direction<double>({PLX_FORMAT_VECTOR3D, 7, 17}, gauss, false);
    every_edge_and_direction<double>({PLX_FORMAT_BGRA, 6, 6}, kLopsided, false);
    every_edge_and_direction<float>({PLX_FORMAT_RGB, 8, 15}, reference::gaussian(2.0), true);
    every_edge_and_direction<uint8_t>({PLX_FORMAT_RGBA, 10, 7}, kLopsided, true);
    every_edge_and_direction<double>({PLX_FORMAT_GREY, 4, 9}, kLopsided, true);
    // A float mask on a double image, and a double mask on a float image.
    expect_matches_reference<double>({PLX_FORMAT_GREY, 6, 19}, -1, PLX_EDGE_EXTEND, gauss, true, false, PLX_TYPE_FLOAT);
    expect_matches_reference<float>({PLX_FORMAT_RGB, 6, 19}, -1, PLX_EDGE_REFLECT, gauss, false, false, PLX_TYPE_DOUBLE);
    for (bool along_y : {false, true}) {
        expect_matches_reference<float>({PLX_FORMAT_RGBA, 9, 21}, 2, PLX_EDGE_REFLECT, kLopsided, along_y, false);
        expect_matches_reference<uint8_t>({PLX_FORMAT_GREY_ALPHA, 12, 10}, 1, PLX_EDGE_ZERO, kLopsided, along_y, true);
        expect_matches_reference<uint16_t>({PLX_FORMAT_GREY, 5, 5}, 0, PLX_EDGE_EXTEND, kLopsided, along_y, false);
    }
}

TEST(Convolve1D, MasksWiderThanTheImage)
{
    // Reflection bounces more than once when the mask reaches past the far edge.
    const std::vector<double> wide = reference::gaussian(2.6);  // 21 taps
    for (Shape s : {Shape{PLX_FORMAT_GREY, 1, 1}, Shape{PLX_FORMAT_GREY, 2, 2}, Shape{PLX_FORMAT_RGB, 3, 1},
                    Shape{PLX_FORMAT_GREY, 1, 3}, Shape{PLX_FORMAT_GREY_ALPHA, 5, 4}}) {
        every_edge_and_direction<float>(s, wide, false);
        every_edge_and_direction<uint8_t>(s, wide, false);
    }
}

TEST(Convolve1D, ResultsDoNotDependOnTheWindowCut)
{
    // Threaded smoothing convolves bands of rows and of columns; any column must come out
    // with the same bits whatever band it falls in and wherever in the band it lies.
    Plx_Image *src = plx_image_form_gen_rgb_f(nullptr, 23, 53);
    Plx_Image *whole = plx_image_form_gen_rgb_f(nullptr, 23, 53);
    Plx_Image *cut = plx_image_form_gen_rgb_f(nullptr, 23, 53);
    reference::fill_noise<float>(src, 3);
    Plx_Mask1D *mask = plx_gauss_mask_new(PLX_TYPE_FLOAT, 1.7, 13, 1.0);
    ASSERT_TRUE(src && whole && cut && mask);
    for (bool along_y : {true, false}) {
        ASSERT_TRUE(along_y ? plx_image_convolve1Dy_q(src, -1, PLX_EDGE_EXTEND, mask, whole)
                            : plx_image_convolve1Dx_q(src, -1, PLX_EDGE_EXTEND, mask, whole));
        const int total = along_y ? src->width : src->height;
        for (int first = 0; first < total;) {
            const int n = std::min(1 + first % 7, total - first);  // bands of 1 to 7
            const Plx_Window w = along_y ? Plx_Window{first, 0, n, src->height} : Plx_Window{0, first, src->width, n};
            Plx_Image sv{}, dv{};
            ASSERT_TRUE(plx_image_extract_q(src, w, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &sv));
            ASSERT_TRUE(plx_image_extract_q(cut, w, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &dv));
            ASSERT_TRUE(along_y ? plx_image_convolve1Dy_q(&sv, -1, PLX_EDGE_EXTEND, mask, &dv)
                                : plx_image_convolve1Dx_q(&sv, -1, PLX_EDGE_EXTEND, mask, &dv));
            first += n;
        }
        for (int y = 0; y < src->height; ++y)
            ASSERT_EQ(std::memcmp(plx_image_row(whole, y), plx_image_row(cut, y), std::size_t(src->width) * 12), 0)
                << (along_y ? "columns" : "rows") << ", row " << y;
    }
    plx_mask1D_free(mask);
    plx_image_free(src);
    plx_image_free(whole);
    plx_image_free(cut);
}

TEST(Convolve1D, IntegerTypesRoundHalvesAwayFromZeroAndClamp)
{
    Plx_Image *si = plx_image_form_gen_gl_i(nullptr, 1, 3);
    Plx_Image *di = plx_image_form_gen_gl_i(nullptr, 1, 3);
    ASSERT_TRUE(si && di);
    int32_t *in = static_cast<int32_t *>(si->data);
    in[0] = 3, in[1] = -3, in[2] = 5;
    double half = 0.5;
    Plx_Mask1D m{PLX_TYPE_DOUBLE, 1, &half};
    ASSERT_TRUE(plx_image_convolve1Dx_q(si, -1, PLX_EDGE_ZERO, &m, di));
    const int32_t *out = static_cast<const int32_t *>(di->data);
    EXPECT_EQ(out[0], 2);
    EXPECT_EQ(out[1], -2);
    EXPECT_EQ(out[2], 3);

    Plx_Image *su = plx_image_form_gen_gl_uc(nullptr, 1, 2);
    Plx_Image *du = plx_image_form_gen_gl_uc(nullptr, 1, 2);
    ASSERT_TRUE(su && du);
    static_cast<uint8_t *>(su->data)[0] = 200;
    static_cast<uint8_t *>(su->data)[1] = 10;
    float gain[3] = {0.0f, 2.0f, 0.0f}, negate[3] = {0.0f, -1.0f, 0.0f};
    Plx_Mask1D g{PLX_TYPE_FLOAT, 3, gain}, n{PLX_TYPE_FLOAT, 3, negate};
    ASSERT_TRUE(plx_image_convolve1Dy_q(su, -1, PLX_EDGE_ZERO, &g, du));
    EXPECT_EQ(static_cast<uint8_t *>(du->data)[0], 255);
    EXPECT_EQ(static_cast<uint8_t *>(du->data)[1], 20);
    ASSERT_TRUE(plx_image_convolve1Dx_q(su, -1, PLX_EDGE_ZERO, &n, du));
    EXPECT_EQ(static_cast<uint8_t *>(du->data)[0], 0);
    for (Plx_Image *im : {si, di, su, du}) plx_image_free(im);
}

TEST(GaussMask, NormalisedSymmetricGaussianAndBadArguments)
{
    for (Plx_PixelType type : {PLX_TYPE_FLOAT, PLX_TYPE_DOUBLE}) {
        Plx_Mask1D *m = plx_gauss_mask_new(type, 1.5, 13, 2.5);
        ASSERT_NE(m, nullptr);
        auto value = [&](int i) {
            return type == PLX_TYPE_FLOAT ? double(static_cast<float *>(m->data)[i]) : static_cast<double *>(m->data)[i];
        };
        double sum = 0;
        for (int i = 0; i < 13; ++i) sum += value(i);
        EXPECT_NEAR(sum, 2.5, 1e-6);
        for (int i = 0; i < 6; ++i) EXPECT_EQ(value(i), value(12 - i));
        // Neighbouring taps of exp(-i^2 / (2 sigma^2)) differ by exp(-(2i+1) / (2 sigma^2)).
        EXPECT_NEAR(value(7) / value(6), std::exp(-1.0 / 4.5), 1e-6);
        EXPECT_NEAR(value(9) / value(8), std::exp(-5.0 / 4.5), 1e-6);
        plx_mask1D_free(m);
    }
    Plx_Mask1D *one = plx_gauss_mask_new(PLX_TYPE_DOUBLE, 0.1, 1, 1.0);
    ASSERT_NE(one, nullptr);
    EXPECT_EQ(static_cast<double *>(one->data)[0], 1.0);
    plx_mask1D_free(one);
    plx_mask1D_free(nullptr);

    EXPECT_TRUE(fails_with(plx_gauss_mask_new(PLX_TYPE_FLOAT, 1.0, 8, 1.0), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(plx_gauss_mask_new(PLX_TYPE_FLOAT, 0.0, 9, 1.0), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(plx_gauss_mask_new(PLX_TYPE_DOUBLE, std::nan(""), 9, 1.0), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(plx_gauss_mask_new(PLX_TYPE_UCHAR, 1.0, 9, 1.0), PLX_ERROR_ILLEGAL_PIXEL_TYPE));
}

TEST(Convolve1D, BadArgumentsFailWithTheirCodesAndLeaveDestAlone)
{
    Plx_Image *src = plx_image_form_gen_rgb_f(nullptr, 4, 6);
    Plx_Image *dst = plx_image_form_gen_rgb_f(nullptr, 4, 6);
    Plx_Image *small = plx_image_form_gen_rgb_f(nullptr, 4, 5);
    Plx_Image *other = plx_image_form_gen_rgb_d(nullptr, 4, 6);
    Plx_Image *bits = plx_image_form_gen_b(nullptr, 4, 6);
    Plx_Image *bits2 = plx_image_form_gen_b(nullptr, 4, 6);
    ASSERT_TRUE(src && dst && small && other && bits && bits2);
    reference::fill_noise<float>(src, 4);
    reference::fill_noise<float>(dst, 5);
    Plx_Image *before = plx_image_copy_q(dst, nullptr);
    ASSERT_NE(before, nullptr);
    float taps[3] = {0.25f, 0.5f, 0.25f};
    int32_t int_taps[3] = {1, 2, 1};
    Plx_Mask1D good{PLX_TYPE_FLOAT, 3, taps}, even{PLX_TYPE_FLOAT, 2, taps}, wrong{PLX_TYPE_INT, 3, int_taps};
    Plx_Image overlap{};
    ASSERT_TRUE(plx_image_extract_q(src, {1, 0, 5, 4}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &overlap));
    Plx_Image src5{};
    ASSERT_TRUE(plx_image_extract_q(src, {0, 0, 5, 4}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &src5));

    struct Bad {
        const Plx_Image *s;
        int32_t channel;
        int edge;
        const Plx_Mask1D *m;
        Plx_Image *d;
        int32_t code;
    } cases[] = {
        {nullptr, -1, 1, &good, dst, PLX_ERROR_ILLEGAL_ARGUMENT},
        {src, -1, 1, nullptr, dst, PLX_ERROR_ILLEGAL_ARGUMENT},
        {src, -1, 1, &good, nullptr, PLX_ERROR_ILLEGAL_ARGUMENT},
        {src, -1, 1, &good, small, PLX_ERROR_INCOMPATIBLE},
        {src, -1, 1, &good, other, PLX_ERROR_INCOMPATIBLE},
        {bits, -1, 1, &good, bits2, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {src, -1, 1, &wrong, dst, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {src, -1, 1, &even, dst, PLX_ERROR_ILLEGAL_ARGUMENT},
        {src, -1, 3, &good, dst, PLX_ERROR_ILLEGAL_TYPE},
        {src, 3, 1, &good, dst, PLX_ERROR_ILLEGAL_ARGUMENT},
        {&src5, -1, 1, &good, &overlap, PLX_ERROR_INCOMPATIBLE},
    };
    for (const Bad &c : cases)
        for (bool along_y : {false, true}) {
            const Plx_EdgeBehaviour edge = static_cast<Plx_EdgeBehaviour>(c.edge);
            EXPECT_TRUE(fails_with(along_y ? plx_image_convolve1Dy_q(c.s, c.channel, edge, c.m, c.d)
                                           : plx_image_convolve1Dx_q(c.s, c.channel, edge, c.m, c.d),
                                   c.code))
                << "case " << (&c - cases);
        }
    for (int y = 0; y < 4; ++y) EXPECT_EQ(std::memcmp(plx_image_row(dst, y), plx_image_row(before, y), 6 * 12), 0);

    Plx_Image *empty = plx_image_form_gen_gl_f(nullptr, 0, 5);
    Plx_Image *empty2 = plx_image_form_gen_gl_f(nullptr, 0, 5);
    EXPECT_TRUE(plx_image_convolve1Dy_q(empty, -1, PLX_EDGE_EXTEND, &good, empty2));
    for (Plx_Image *im : {src, dst, small, other, bits, bits2, before, empty, empty2}) plx_image_free(im);
    plx_image_free(&overlap);
    plx_image_free(&src5);
}

// ---- the same bits whichever instruction set the kernel runs with ----

namespace {

// Runs the kernel of every build over the same sources (each starting at an odd offset, runs
// of several lengths) and requires identical bits; fixed point also against its lane model.
template <class A, bool Sym>
void expect_same_bits_on_every_build(uint32_t ntaps, uint32_t seed)
{
    constexpr std::size_t W = plx::conv::Lanes<A>::W;
    std::mt19937 gen(seed);
    std::vector<A> k(ntaps);
    for (uint32_t t = 0; t <= ntaps / 2; ++t) {
        if constexpr (std::is_same_v<A, uint16_t>)
            k[t] = k[ntaps - 1 - t] = A(std::uniform_int_distribution<int>(0, 65535 / ntaps)(gen));
        else
            k[t] = A(std::uniform_real_distribution<double>(-1, 1)(gen)), k[ntaps - 1 - t] = Sym ? k[t] : A(std::uniform_real_distribution<double>(-1, 1)(gen));
    }
    for (std::size_t n : {W, 3 * W, 4 * W, 9 * W, 13 * W}) {
        std::vector<A> pool(std::size_t(ntaps) * (n + 9) + 1);
        for (A &v : pool) {
            if constexpr (std::is_same_v<A, uint16_t>)
                v = A(std::uniform_int_distribution<int>(0, 255)(gen) << 7);
            else
                v = A(std::uniform_real_distribution<double>(-100, 100)(gen));
        }
        std::vector<const A *> src(ntaps);
        for (uint32_t t = 0; t < ntaps; ++t) src[t] = pool.data() + t * (n + 7) + 2 * t + 1;  // odd, unaligned
        std::vector<A> base(n), wide(n);
        plx::conv::taps<A, Sym>(plx::conv::Isa::baseline, base.data(), src.data(), k.data(), ntaps, n);
        plx::conv::taps<A, Sym>(plx::conv::Isa::avx2, wide.data(), src.data(), k.data(), ntaps, n);
        ASSERT_EQ(std::memcmp(base.data(), wide.data(), n * sizeof(A)), 0) << "taps " << ntaps << " run " << n;
        if constexpr (std::is_same_v<A, uint16_t>) {
            std::vector<A> model(n);
            plx::conv::fixed_taps_scalar(model.data(), src.data(), k.data(), ntaps, n);
            ASSERT_EQ(model, base) << "taps " << ntaps << " run " << n;
        }
    }
}

}  // namespace

TEST(ConvolveKernels, SameBitsOnEveryInstructionSet)
{
#if defined(__x86_64__) || defined(__i386__)
    if (!__builtin_cpu_supports("avx2")) GTEST_SKIP() << "no AVX2 on this machine";
#endif
    uint32_t seed = 1;
    for (uint32_t ntaps : {1u, 3u, 9u, 17u, 33u}) {
        expect_same_bits_on_every_build<float, true>(ntaps, seed++);
        expect_same_bits_on_every_build<float, false>(ntaps, seed++);
        expect_same_bits_on_every_build<double, true>(ntaps, seed++);
        expect_same_bits_on_every_build<double, false>(ntaps, seed++);
        expect_same_bits_on_every_build<uint16_t, true>(ntaps, seed++);
    }
}

// Whole convolutions of float and double images (odd sizes, a view at an odd offset) give,
// value by value, the bits of the baseline kernel: the library's result is the one every
// machine gives, wherever a value sits in its run.
template <class T>
void expect_baseline_bits(const std::vector<double> &taps, bool along_y)
{
    constexpr std::size_t W = plx::conv::Lanes<T>::W;
    const Plx_PixelType type = plx::PixelTraits<T>::code;
    Plx_Image *parent = plx_image_form_gen(nullptr, PLX_FORMAT_GREY, type, 24, 40);
    Plx_Image *dest = plx_image_form_gen(nullptr, PLX_FORMAT_GREY, type, 21, 37);
    ASSERT_TRUE(parent && dest);
    reference::fill_noise<T>(parent, 5);
    Plx_Image src{};
    ASSERT_TRUE(plx_image_extract_q(parent, {3, 1, 37, 21}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &src));
    std::vector<T> k(taps.begin(), taps.end());
    Plx_Mask1D mask{type, uint32_t(k.size()), k.data()};
    ASSERT_TRUE(along_y ? plx_image_convolve1Dy_q(&src, -1, PLX_EDGE_EXTEND, &mask, dest)
                        : plx_image_convolve1Dx_q(&src, -1, PLX_EDGE_EXTEND, &mask, dest));
    const int r = int(k.size() / 2);
    const bool sym = std::equal(k.begin(), k.end(), k.rbegin());
    std::vector<T> lanes(k.size() * W), out(W);
    std::vector<const T *> rows(k.size());
    for (int y = 0; y < 21; ++y)
        for (int x = 0; x < 37; ++x) {
            for (int t = 0; t < int(k.size()); ++t) {
                const int yy = along_y ? std::clamp(y + t - r, 0, 20) : y, xx = along_y ? x : std::clamp(x + t - r, 0, 36);
                std::fill(lanes.begin() + t * W, lanes.begin() + (t + 1) * W, *reference::at<T>(&src, yy, xx, 0));
                rows[t] = lanes.data() + t * W;
            }
            if (sym)
                plx::conv::taps<T, true>(plx::conv::Isa::baseline, out.data(), rows.data(), k.data(), uint32_t(k.size()), W);
            else
                plx::conv::taps<T, false>(plx::conv::Isa::baseline, out.data(), rows.data(), k.data(), uint32_t(k.size()), W);
            ASSERT_EQ(std::memcmp(reference::at<T>(dest, y, x, 0), out.data(), sizeof(T)), 0) << y << " " << x << (along_y ? " along y" : " along x");
        }
    plx_image_free(&src);
    plx_image_free(parent);
    plx_image_free(dest);
}

TEST(ConvolveKernels, LibraryGivesTheBaselineBits)
{
    const std::vector<double> gauss = {0.054, 0.242, 0.399, 0.242, 0.054};
    const std::vector<double> skew = {0.3, -0.2, 0.9, 0.15, 0.05, -0.1, 0.7};
    for (const auto &taps : {gauss, skew})
        for (bool along_y : {false, true}) {
            expect_baseline_bits<float>(taps, along_y);
            expect_baseline_bits<double>(taps, along_y);
        }
}
