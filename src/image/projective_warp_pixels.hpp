// Pixel reading, format conversion, colour correction and writing of the projective warp,
// written once over compile-time pixel types and formats. Pixels are floats between
// reading and writing; 8- and 16-bit samples are read through two process-wide tables.
#ifndef PLANO_SRC_IMAGE_PROJECTIVE_WARP_PIXELS_HPP
#define PLANO_SRC_IMAGE_PROJECTIVE_WARP_PIXELS_HPP

#include <cmath>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <type_traits>

#include "pellux/image.h"

namespace plano::warp {

// Tag of single-bit pixels (grey bit images): read as 0 or 1, written as set from 0.5.
struct Bit {};

// Normalised float value of every 8-bit and 16-bit level (v / 255, v / 65535), built on first
// use and kept for the life of the process. Each entry is the correctly rounded quotient, so
// reading a level and writing it back gives the same level.
const float *lut8();
const float *lut16();

// ---- reading ----

template <class T, int C>
struct SourceRows {
    const char *data;
    std::ptrdiff_t stride;
    const float *lut;

    explicit SourceRows(const Plx_Image *image)
        : data(static_cast<const char *>(image->data)), stride(image->stride), lut(nullptr)
    {
        if constexpr (std::is_same_v<T, uint8_t>) lut = lut8();
        if constexpr (std::is_same_v<T, uint16_t>) lut = lut16();
    }
    const T *row(int32_t r) const { return reinterpret_cast<const T *>(data + r * stride); }
    // Channel ch of pixel c of a row.
    float get(const T *row, int32_t c, int ch) const
    {
        const T v = row[std::ptrdiff_t(c) * C + ch];
        if constexpr (std::is_same_v<T, uint8_t> || std::is_same_v<T, uint16_t>)
            return lut[v];
        else
            return static_cast<float>(v);
    }
};

template <int C>
struct SourceRows<Bit, C> {
    const char *data;
    std::ptrdiff_t stride;

    explicit SourceRows(const Plx_Image *image)
        : data(static_cast<const char *>(image->data)), stride(image->stride)
    {
    }
    const uint32_t *row(int32_t r) const { return reinterpret_cast<const uint32_t *>(data + r * stride); }
    float get(const uint32_t *row, int32_t c, int) const { return float((row[c >> 5] >> (c & 31)) & 1u); }
};

// A bit of a bit image, frame-offset handled by the caller; false outside the image.
inline bool bit_at(const Plx_Image *image, int32_t r, int32_t c)
{
    if (r < 0 || c < 0 || r >= image->height || c >= image->width) return false;
    const auto *row = static_cast<const uint32_t *>(plx_image_row(image, r));
    return ((row[c >> 5] >> (c & 31)) & 1u) != 0;
}

inline void clear_bit(Plx_Image *image, int32_t r, int32_t c)
{
    if (r < 0 || c < 0 || r >= image->height || c >= image->width) return;
    auto *row = static_cast<uint32_t *>(plx_image_row(image, r));
    row[c >> 5] &= ~(1u << (c & 31));
}

// ---- writing ----

// Float to a stored value, rounding to nearest (halves away from zero) and clamping, as the
// image layer converts; NaN becomes the lowest value.
template <class T>
inline T store_value(float v)
{
    if constexpr (std::is_same_v<T, uint8_t> || std::is_same_v<T, uint16_t>) {
        // Branch-free, so that whole rows convert in vector registers.
        constexpr float scale = std::is_same_v<T, uint8_t> ? 255.0f : 65535.0f;
        float s = v * scale + 0.5f;
        s = s > 0.0f ? s : 0.0f;  // NaN too
        s = s < scale ? s : scale;
        return T(int32_t(s));
    } else if constexpr (std::is_same_v<T, int32_t> || std::is_same_v<T, uint32_t>) {
        const double s = v;
        constexpr double lo = double(std::numeric_limits<T>::lowest());
        constexpr double hi = double(std::numeric_limits<T>::max());
        if (!(s >= lo)) return std::numeric_limits<T>::lowest();
        if (s >= hi) return std::numeric_limits<T>::max();
        return T(s < 0 ? s - 0.5 : s + 0.5);
    } else {
        return T(v);
    }
}

// ---- formats ----

struct FormatInfo {
    int channels;
    bool alpha;
    bool colour;
    bool bgr;
};

constexpr FormatInfo format_info(Plx_ImageFormat f)
{
    switch (f) {
    case PLX_FORMAT_GREY: return {1, false, false, false};
    case PLX_FORMAT_GREY_ALPHA: return {2, true, false, false};
    case PLX_FORMAT_RGB: return {3, false, true, false};
    case PLX_FORMAT_RGBA: return {4, true, true, false};
    case PLX_FORMAT_BGR: return {3, false, true, true};
    case PLX_FORMAT_BGRA: return {4, true, true, true};
    default: return {0, false, false, false};
    }
}

// The format pixels are corrected in when source and output formats differ: RGB with alpha
// if either has it, else blue-first RGB with alpha, else blue-first RGB, else RGB; grey with
// alpha is met by adding alpha to the result (and by itself when neither side is colour).
constexpr Plx_ImageFormat working_format(Plx_ImageFormat s, Plx_ImageFormat o)
{
    if (s == o) return s;
    const FormatInfo si = format_info(s), oi = format_info(o);
    if (!si.colour && !oi.colour) return (si.alpha || oi.alpha) ? PLX_FORMAT_GREY_ALPHA : PLX_FORMAT_GREY;
    Plx_ImageFormat w = PLX_FORMAT_RGB;
    if (s == PLX_FORMAT_RGBA || o == PLX_FORMAT_RGBA)
        w = PLX_FORMAT_RGBA;
    else if (s == PLX_FORMAT_BGRA || o == PLX_FORMAT_BGRA)
        w = PLX_FORMAT_BGRA;
    else if (s == PLX_FORMAT_BGR || o == PLX_FORMAT_BGR)
        w = PLX_FORMAT_BGR;
    if ((si.alpha || oi.alpha) && !format_info(w).alpha) w = w == PLX_FORMAT_BGR ? PLX_FORMAT_BGRA : PLX_FORMAT_RGBA;
    return w;
}

// Colour correction with single-precision coefficients; mode -1 is none.
struct Correction {
    int32_t mode = -1;
    float c[12] = {};
};

// Converts pixel s of format S into d of format D: colour to grey through Rec. 709
// luminance, grey to colour by repetition; alpha from S, else `alpha` (1, or the coverage of
// the high-quality path).
template <Plx_ImageFormat S, Plx_ImageFormat D>
inline void convert_pixel(const float *s, float alpha, float *d)
{
    constexpr FormatInfo si = format_info(S), di = format_info(D);
    if constexpr (S == D) {
        for (int i = 0; i < si.channels; ++i) d[i] = s[i];
        if constexpr (!si.alpha) (void)alpha;
    } else {
        const float a = si.alpha ? s[si.channels - 1] : alpha;
        if constexpr (si.colour) {
            const float r = si.bgr ? s[2] : s[0], g = s[1], b = si.bgr ? s[0] : s[2];
            if constexpr (di.colour) {
                d[0] = di.bgr ? b : r;
                d[1] = g;
                d[2] = di.bgr ? r : b;
            } else {
                d[0] = 0.2126f * r + 0.7152f * g + 0.0722f * b;
            }
        } else {
            const float grey = s[0];
            for (int i = 0; i < (di.colour ? 3 : 1); ++i) d[i] = grey;
        }
        if constexpr (di.alpha) d[di.channels - 1] = a;
    }
}

template <Plx_ImageFormat W>
inline void correct_pixel(const Correction &cc, float *p)
{
    constexpr FormatInfo wi = format_info(W);
    constexpr int colours = wi.colour ? 3 : 1;
    switch (cc.mode) {
    case 0:
        for (int i = 0; i < colours; ++i) p[i] = cc.c[0] * p[i] + cc.c[1];
        break;
    case 1:
        if constexpr (wi.colour) {
            const float a = p[0], b = p[1], c = p[2];
            p[0] = cc.c[0] * a + cc.c[1] * b + cc.c[2] * c + cc.c[9];
            p[1] = cc.c[3] * a + cc.c[4] * b + cc.c[5] * c + cc.c[10];
            p[2] = cc.c[6] * a + cc.c[7] * b + cc.c[8] * c + cc.c[11];
        }
        break;
    case 2:
        if constexpr (wi.colour) {
            p[0] *= wi.bgr ? cc.c[2] : cc.c[0];
            p[1] *= cc.c[1];
            p[2] *= wi.bgr ? cc.c[0] : cc.c[2];
        } else {
            p[0] *= cc.c[3];
        }
        break;
    default: break;
    }
}

}  // namespace plano::warp

#endif
