// Helpers of the projective-warp tests: owned images, textures, pixel access, and a
// plainly written reference of one bilinear sample.
#ifndef PLANO_TESTS_IMAGE_WARP_TEST_UTIL_HPP
#define PLANO_TESTS_IMAGE_WARP_TEST_UTIL_HPP

#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <memory>
#include <vector>

#include "plano/plano.h"

namespace warp_test {

struct ImageFree {
    void operator()(Plx_Image *im) const { plx_image_free(im); }
};
using Image = std::unique_ptr<Plx_Image, ImageFree>;

inline Image make(Plx_ImageFormat f, Plx_PixelType t, int32_t h, int32_t w, int32_t x = 0, int32_t y = 0)
{
    Image im(plx_image_form_gen(nullptr, f, t, h, w));
    EXPECT_NE(im, nullptr);
    plx_image_fill_zero(im.get());
    im->x = x, im->y = y;
    return im;
}

inline Image make_bits(int32_t h, int32_t w, bool set, int32_t x = 0, int32_t y = 0)
{
    Image im = make(PLX_FORMAT_GREY, PLX_TYPE_BIT, h, w, x, y);
    const double one = 1.0;
    if (set) plx_image_fill_const(im.get(), &one);
    return im;
}

// Full scale of a type in stored units.
inline double full_scale(Plx_PixelType t)
{
    switch (t) {
    case PLX_TYPE_UCHAR: return 255.0;
    case PLX_TYPE_USHORT: return 65535.0;
    case PLX_TYPE_INT:
    case PLX_TYPE_UINT: return 1000.0;
    default: return 1.0;
    }
}

// A smooth but non-linear texture in [0.05, 0.95] of full scale, different per channel.
inline double texture(int32_t r, int32_t c, int ch)
{
    return 0.5 + 0.45 * std::sin(0.37 * c + 0.9 * ch) * std::cos(0.23 * r - 0.4 * ch);
}

inline void fill_texture(Plx_Image *im)
{
    const uint32_t n = plx_image_format_channels(im->format);
    const double s = full_scale(im->type);
    std::vector<double> v(n);
    for (int32_t r = 0; r < im->height; ++r)
        for (int32_t c = 0; c < im->width; ++c) {
            for (uint32_t k = 0; k < n; ++k) {
                v[k] = texture(r, c, int(k)) * s;
                if (im->type != PLX_TYPE_FLOAT && im->type != PLX_TYPE_DOUBLE) v[k] = std::round(v[k]);
            }
            plx_image_set_pixel(im, r, c, v.data());
        }
}

inline std::vector<double> pixel(const Plx_Image *im, int32_t r, int32_t c)
{
    std::vector<double> v(plx_image_format_channels(im->format));
    EXPECT_TRUE(plx_image_get_pixel(im, r, c, v.data()));
    return v;
}

inline bool bit(const Plx_Image *im, int32_t r, int32_t c) { return plx_image_get_bit(im, r, c) != 0; }

// Bytes of the pixels of two images of equal shape are equal.
inline bool same_pixels(const Plx_Image *a, const Plx_Image *b)
{
    if (a->height != b->height || a->width != b->width || a->format != b->format || a->type != b->type) return false;
    if (a->type == PLX_TYPE_BIT) {
        for (int32_t r = 0; r < a->height; ++r)
            for (int32_t c = 0; c < a->width; ++c)
                if (bit(a, r, c) != bit(b, r, c)) return false;
        return true;
    }
    const std::size_t row = std::size_t(a->width) * plx_image_format_channels(a->format) * plx_image_type_size(a->type);
    for (int32_t r = 0; r < a->height; ++r)
        if (std::memcmp(plx_image_row(a, r), plx_image_row(b, r), row) != 0) return false;
    return true;
}

inline Image copy(const Plx_Image *im)
{
    Image c(plx_image_copy_q(im, nullptr));
    EXPECT_NE(c, nullptr);
    return c;
}

inline Plx_Matrix33 matrix(double a, double b, double c, double d, double e, double f, double g, double h, double i)
{
    return Plx_Matrix33{{{a, b, c}, {d, e, f}, {g, h, i}}};
}

inline Plx_Matrix33 translation(double tx, double ty) { return matrix(1, 0, tx, 0, 1, ty, 0, 0, 1); }

// The whole warp with defaults for what a test does not set.
inline Plx_Bool warp(const Plx_Image *source, Plx_Image *output, const Plx_Matrix33 *H,
                     const ProjectiveWarpParams *params = nullptr, Plx_Image *validity = nullptr,
                     const Plx_Image *source_mask = nullptr, const Plx_Image *output_mask = nullptr,
                     const Plx_Camera *cam_a = nullptr, const Plx_Camera *cam_b = nullptr,
                     const ThreadHostInterface *host = nullptr, uint32_t *stats = nullptr)
{
    return bImageProjectiveWarp(output, output_mask, cam_a, source, source_mask, cam_b, H, params, output, validity,
                                host, stats, 0);
}

inline int32_t last_code()
{
    const uint32_t n = plx_err_get_error_count();
    Plx_ErrorRecord r{};
    if (n == 0 || !plx_err_get_error(0, &r)) return -1;
    return r.code;
}

// Bilinear sample of channel ch of a float image at source-local (x, y) minus 0.5, in double.
inline double reference_sample(const Plx_Image *im, double x, double y, int ch)
{
    const int32_t ix = int32_t(std::floor(x)), iy = int32_t(std::floor(y));
    const double fx = x - ix, fy = y - iy;
    auto at = [&](int32_t r, int32_t c) { return pixel(im, r, c)[ch]; };
    return (1 - fx) * (1 - fy) * at(iy, ix) + fx * (1 - fy) * at(iy, ix + 1) + (1 - fx) * fy * at(iy + 1, ix) +
           fx * fy * at(iy + 1, ix + 1);
}

}  // namespace warp_test

#endif
