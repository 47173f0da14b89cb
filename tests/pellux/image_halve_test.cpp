// Halving and pyramids: coordinate-encoded pixels, rounding of integer means, the AND rule of
// bit levels, storage reuse between builds, and refusals.
#include "image_test_util.hpp"

using namespace plx_test;

namespace {

// Bit (r, c) of level l: set when the whole 2^l x 2^l block of the full mask is set.
bool block_all_set(const std::vector<uint8_t> &full, int32_t w, int32_t r, int32_t c, int l)
{
    int32_t s = 1 << l;
    for (int32_t i = 0; i < s; ++i)
        for (int32_t j = 0; j < s; ++j)
            if (!full[size_t(r * s + i) * w + size_t(c * s + j)]) return false;
    return true;
}

}  // namespace

TEST(ImageHalve, MeansOfBlocksWithIntegerRounding)
{
    // value = 1000 k + 10 r + c in channel k: the mean of a 2x2 block is its centre's code.
    ImagePtr im = make(PLX_FORMAT_RGB, PLX_TYPE_FLOAT, 7, 9);
    for (int32_t r = 0; r < 7; ++r)
        for (int32_t c = 0; c < 9; ++c) set(im.get(), r, c, {10.0 * r + c, 1000 + 10.0 * r + c, 2000 + 10.0 * r + c});
    im->x = 5;
    im->y = -3;
    ImagePtr h(plx_image_halve_size(im.get(), nullptr));
    ASSERT_NE(h, nullptr);
    EXPECT_EQ(std::vector<int>({h->height, h->width, h->x, h->y}), std::vector<int>({3, 4, 2, -2}));
    for (int32_t r = 0; r < 3; ++r)
        for (int32_t c = 0; c < 4; ++c) {
            double centre = 10.0 * (2 * r + 0.5) + (2 * c + 0.5);
            EXPECT_EQ(pixel(h.get(), r, c), (std::vector<double>{centre, 1000 + centre, 2000 + centre}));
        }

    const struct {
        Plx_PixelType type;
        double v[4], mean;
    } cases[] = {
        {PLX_TYPE_UCHAR, {1, 2, 2, 2}, 2},     {PLX_TYPE_UCHAR, {1, 1, 1, 2}, 1},  // 1.75, 1.25
        {PLX_TYPE_UCHAR, {0, 0, 1, 1}, 1},     {PLX_TYPE_USHORT, {65535, 65535, 65535, 65534}, 65535},
        {PLX_TYPE_INT, {-1, -1, 0, 0}, 0},     {PLX_TYPE_INT, {-1, -1, -1, 0}, -1},  // -0.5, -0.75
        {PLX_TYPE_UINT, {4e9, 4e9, 4e9, 4e9 + 2}, 4e9 + 1},                        // no overflow
        {PLX_TYPE_DOUBLE, {1, 2, 2, 2}, 1.75},
    };
    for (const auto &c : cases) {
        ImagePtr g = make(PLX_FORMAT_GREY, c.type, 2, 3);
        for (int i = 0; i < 4; ++i) set(g.get(), i / 2, i % 2, {c.v[i]});
        ImagePtr hg(plx_image_halve_size(g.get(), nullptr));
        EXPECT_EQ(pixel(hg.get(), 0, 0)[0], c.mean) << "type " << c.type << " first value " << c.v[0];
    }
}

TEST(ImageHalve, BitsAreSetWhenTheWholeBlockIsSet)
{
    for (int32_t w : {3, 63, 64, 67, 130}) {
        ImagePtr bits = random_bits(9, w, 0.8, 90 + w);
        const std::vector<uint8_t> full = bits_of(bits.get());
        ImagePtr h(plx_image_halve_size(bits.get(), nullptr));
        ASSERT_EQ(h->width, w / 2);
        ASSERT_EQ(h->height, 4);
        for (int32_t r = 0; r < 4; ++r) {
            EXPECT_EQ(padding(h.get(), r), 0u);
            for (int32_t c = 0; c < w / 2; ++c)
                ASSERT_EQ(plx_image_get_bit(h.get(), r, c), block_all_set(full, w, r, c, 1)) << w << " " << r << "," << c;
        }
    }
    ImagePtr ptrs = make(PLX_FORMAT_POINTER, PLX_TYPE_POINTER, 4, 4), im = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 4, 4);
    EXPECT_EQ(plx_image_halve_size(ptrs.get(), nullptr), nullptr);
    EXPECT_EQ(last_code(), PLX_ERROR_ILLEGAL_PIXEL_TYPE);
    EXPECT_EQ(plx_image_halve_size(im.get(), im.get()), nullptr);
    EXPECT_EQ(last_code(), PLX_ERROR_ILLEGAL_ARGUMENT);
    EXPECT_EQ(im->width, 4);
}

TEST(ImagePyramid, LevelsAreSuccessiveHalvingsWithAndedMasks)
{
    const int32_t h = 26, w = 41;
    ImagePtr im = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, h, w);
    for (int32_t r = 0; r < h; ++r)
        for (int32_t c = 0; c < w; ++c) set(im.get(), r, c, {100.0 * r + c});
    ImagePtr mask = random_bits(h, w, 0.9, 123);
    const std::vector<uint8_t> full = bits_of(mask.get());

    Plx_ImagePyramid pyr{};
    ASSERT_TRUE(plx_image_pyramid_build_preallocated(&pyr, im.get(), mask.get(), 3));
    ASSERT_EQ(pyr.no_levels, 3u);
    EXPECT_EQ(pyr.level[0].image, im.get());  // borrowed
    EXPECT_EQ(pyr.level[0].mask, mask.get());
    const int32_t sizes[3][2] = {{26, 41}, {13, 20}, {6, 10}};
    for (int l = 0; l < 3; ++l) {
        const Plx_Image *li = pyr.level[l].image, *lm = pyr.level[l].mask;
        ASSERT_EQ(std::vector<int>({li->height, li->width, lm->height, lm->width}),
                  std::vector<int>({sizes[l][0], sizes[l][1], sizes[l][0], sizes[l][1]}));
        const int32_t s = 1 << l;
        for (int32_t r = 0; r < li->height; ++r)
            for (int32_t c = 0; c < li->width; ++c) {
                double centre = 100.0 * (s * r + (s - 1) / 2.0) + (s * c + (s - 1) / 2.0);
                ASSERT_EQ(pixel(li, r, c)[0], centre) << l;
                ASSERT_EQ(plx_image_get_bit(lm, r, c), block_all_set(full, w, r, c, l)) << l;
            }
    }

    // A rebuild with fewer levels and no mask reuses the level records and their pixels;
    // growing again keeps them.
    Plx_Image *level1 = pyr.level[1].image;
    void *level1_pixels = level1->data;
    ImagePtr smaller = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 20, 30);
    plx_image_fill_zero(smaller.get());
    ASSERT_TRUE(plx_image_pyramid_build_preallocated(&pyr, smaller.get(), nullptr, 2));
    EXPECT_EQ(pyr.level[1].image, level1);
    EXPECT_EQ(level1->data, level1_pixels);
    EXPECT_EQ(level1->width, 15);
    EXPECT_EQ(pyr.level[1].mask, nullptr);
    ASSERT_TRUE(plx_image_pyramid_build_preallocated(&pyr, smaller.get(), nullptr, 4));
    EXPECT_EQ(pyr.level[1].image, level1);
    EXPECT_EQ(pyr.level[3].image->height, 2);

    // Refusals leave the pyramid as it was.
    ImagePtr narrow_mask = make(PLX_FORMAT_GREY, PLX_TYPE_BIT, 20, 29), byte_mask = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 20, 30);
    expect_failures({
        {[&] { return plx_image_pyramid_build_preallocated(&pyr, smaller.get(), nullptr, 6); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_pyramid_build_preallocated(&pyr, smaller.get(), nullptr, 0); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_pyramid_build_preallocated(&pyr, smaller.get(), narrow_mask.get(), 2); }, PLX_ERROR_INCOMPATIBLE},
        {[&] { return plx_image_pyramid_build_preallocated(&pyr, smaller.get(), byte_mask.get(), 2); }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_pyramid_build_preallocated(&pyr, nullptr, nullptr, 2); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_pyramid_build_preallocated(nullptr, smaller.get(), nullptr, 2); }, PLX_ERROR_ILLEGAL_ARGUMENT},
    });
    EXPECT_EQ(pyr.no_levels, 4u);
    EXPECT_EQ(pyr.level[1].image, level1);

    plx_image_pyramid_free(&pyr);
    EXPECT_EQ(pyr.level, nullptr);
    plx_image_pyramid_free(&pyr);  // a second free is harmless
    EXPECT_EQ(im->width, w);       // the caller's level 0 is left alone
}
