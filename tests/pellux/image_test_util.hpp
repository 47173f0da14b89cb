// Helpers of the image tests: self-freeing images, random bit images, pixel read-back.
#ifndef PLANO_TESTS_PELLUX_IMAGE_TEST_UTIL_HPP
#define PLANO_TESTS_PELLUX_IMAGE_TEST_UTIL_HPP

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <memory>
#include <random>
#include <vector>

#include "pellux/pellux.h"

namespace plx_test {

struct ImageDeleter {
    void operator()(Plx_Image *im) const { plx_image_free(im); }
};
using ImagePtr = std::unique_ptr<Plx_Image, ImageDeleter>;

inline ImagePtr make(Plx_ImageFormat f, Plx_PixelType t, int32_t h, int32_t w)
{
    return ImagePtr(plx_image_form_gen(nullptr, f, t, h, w));
}

// Code of the origin record of the last failure.
inline int32_t last_code()
{
    Plx_ErrorRecord r;
    return plx_err_get_error(0, &r) ? r.code : 0;
}

inline ImagePtr random_bits(int32_t h, int32_t w, double p, unsigned seed)
{
    ImagePtr im = make(PLX_FORMAT_GREY, PLX_TYPE_BIT, h, w);
    std::mt19937 rng(seed);
    std::bernoulli_distribution bit(p);
    for (int32_t r = 0; r < h; ++r)
        for (int32_t c = 0; c < w; ++c) plx_image_set_bit(im.get(), r, c, bit(rng));
    return im;
}

// One byte per pixel of a bit image, row-major.
inline std::vector<uint8_t> bits_of(const Plx_Image *im)
{
    std::vector<uint8_t> v;
    for (int32_t r = 0; r < im->height; ++r)
        for (int32_t c = 0; c < im->width; ++c) v.push_back(uint8_t(plx_image_get_bit(im, r, c)));
    return v;
}

// The bits of a row's last word past the width (zero in an image of its own).
inline uint32_t padding(const Plx_Image *im, int32_t r)
{
    return im->width % 32 ? static_cast<uint32_t *>(plx_image_row(im, r))[im->width / 32] >> (im->width % 32) : 0;
}

// Every byte of every row, to check that nothing was touched.
inline std::vector<uint8_t> raw_bytes(const Plx_Image *im)
{
    std::vector<uint8_t> v;
    for (int32_t r = 0; r < im->height; ++r) {
        const uint8_t *p = static_cast<const uint8_t *>(plx_image_row(im, r));
        v.insert(v.end(), p, p + im->stride);
    }
    return v;
}

inline std::vector<double> pixel(const Plx_Image *im, int32_t r, int32_t c)
{
    std::vector<double> v(4, -1.0);
    EXPECT_TRUE(plx_image_get_pixel(im, r, c, v.data()));
    v.resize(plx_image_format_channels(im->format));
    return v;
}

inline std::vector<int> as_vec(Plx_Window w) { return {w.x, w.y, w.width, w.height}; }

// Each call must fail and register the paired code at the origin of the trace.
using FailingCall = std::pair<std::function<bool()>, int32_t>;
inline void expect_failures(const std::vector<FailingCall> &calls)
{
    for (size_t i = 0; i < calls.size(); ++i) {
        EXPECT_FALSE(calls[i].first()) << "call " << i;
        EXPECT_EQ(last_code(), calls[i].second) << "call " << i;
    }
}

inline void set(Plx_Image *im, int32_t r, int32_t c, std::vector<double> v)
{
    EXPECT_TRUE(plx_image_set_pixel(im, r, c, v.data()));
}

}  // namespace plx_test

#endif
