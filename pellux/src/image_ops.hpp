// Helpers shared by the image operations: argument checks, destination preparation, bit-row
// access and the row converter between formats and pixel types.
#ifndef PELLUX_SRC_IMAGE_OPS_HPP
#define PELLUX_SRC_IMAGE_OPS_HPP

#include <bit>
#include <cfloat>
#include <cstdint>
#include <limits>
#include <type_traits>

#include "pellux/error.h"
#include "pellux/image.h"

// Register a failure (or a callee's failure) on behalf of the exported function `fn`.
#define PLX_ERR_START_FN(fn, code, message, number) PLX_ERR_START_AS((fn), (code), (message), (number))
#define PLX_ERR_PASS_FN(fn)                                                                    \
    plx_err_register_fileline((fn), PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0)

namespace plx {

// ---- checks: each registers its own failure under fn and returns false ----

// image not null (code 32) and its format/type pair valid (codes 39/38).
bool check_image(const Plx_Image *image, const char *fn);
// check_image, and a grey bit image (code 38 otherwise).
bool check_bit_image(const Plx_Image *image, const char *fn);
// check_image, and not a pointer image (code 38): operations that read values as numbers.
bool check_value_image(const Plx_Image *image, const char *fn);
// Two images of the same height and width (code 7).
bool check_same_size(const Plx_Image *a, const Plx_Image *b, const char *fn);
// row and col inside the image (code 32).
bool check_inside(const Plx_Image *image, int32_t row, int32_t col, const char *fn);
// window inside the image with non-negative sizes (code 32).
bool check_window(const Plx_Image *image, Plx_Window window, const char *fn);
// Whether pixels of one format and type can be converted to another (codes 39/38 when not).
bool check_conversion(Plx_ImageFormat sf, Plx_PixelType st, Plx_ImageFormat df, Plx_PixelType dt,
                      const char *fn);

// Makes dest an image of the given format, type and size. A dest that already has them is
// left as it is (so an operand may also be the destination, and a view of the right shape
// receives the result in place); otherwise it is re-formed (a zeroed record is formed).
// Registers code 1 under fn after the callee's record when that fails.
bool prepare_dest(Plx_Image *dest, Plx_ImageFormat format, Plx_PixelType type, int32_t height,
                  int32_t width, const char *fn);

// dest when given (prepared as by prepare_dest), else a new image record; made tells which,
// so a failing caller can free what it made. Null on failure (recorded under fn).
Plx_Image *acquire_dest(Plx_Image *dest, Plx_ImageFormat format, Plx_PixelType type,
                        int32_t height, int32_t width, const char *fn, bool &made);

// A record that shows pixels it does not own (a view into another image).
inline bool is_view(const Plx_Image *image) { return image->block == nullptr && image->data != nullptr; }

// ---- bit rows ----
// A bit row is an array of 32-bit words; pixel c is bit c % 32 of word c / 32. Writers touch
// only the bits of the pixels they write: the bits past the width in a row's last word belong
// to the parent image when the record is a view, and stay zero in an image of its own.

inline int32_t bit_words(int32_t width) { return (width + 31) / 32; }
// Mask of the pixels of the last word of a row of this width (all ones for a full word).
inline uint32_t bit_tail_mask(int32_t width)
{
    int32_t rem = width & 31;
    return rem == 0 ? 0xFFFFFFFFu : (1u << rem) - 1u;
}
inline uint32_t *bit_row(const Plx_Image *image, int32_t r)
{
    return static_cast<uint32_t *>(plx_image_row(image, r));
}
inline bool get_bit(const uint32_t *row, int64_t c) { return (row[c >> 5] >> (c & 31)) & 1u; }
inline void set_bit(uint32_t *row, int64_t c, bool v)
{
    uint32_t m = 1u << (c & 31);
    row[c >> 5] = v ? (row[c >> 5] | m) : (row[c >> 5] & ~m);
}
// Bits [pos, pos + count) of a row in the low bits of the result (1 <= count <= 32); reads
// only the words that hold them.
inline uint32_t get_bits(const uint32_t *row, int64_t pos, int32_t count)
{
    int64_t w = pos >> 5;
    int32_t s = static_cast<int32_t>(pos & 31);
    uint64_t v = row[w] >> s;
    if (s + count > 32) v |= static_cast<uint64_t>(row[w + 1]) << (32 - s);
    uint64_t m = count == 32 ? 0xFFFFFFFFull : (1ull << count) - 1ull;
    return static_cast<uint32_t>(v & m);
}
// Writes the low count bits of v into bits [pos, pos + count), leaving every other bit.
inline void put_bits(uint32_t *row, int64_t pos, uint32_t v, int32_t count)
{
    int64_t w = pos >> 5;
    int32_t s = static_cast<int32_t>(pos & 31);
    uint64_t m = (count == 32 ? 0xFFFFFFFFull : (1ull << count) - 1ull) << s;
    uint64_t val = (static_cast<uint64_t>(v) << s) & m;
    row[w] = (row[w] & ~static_cast<uint32_t>(m)) | static_cast<uint32_t>(val);
    if (s + count > 32)
        row[w + 1] = (row[w + 1] & ~static_cast<uint32_t>(m >> 32)) | static_cast<uint32_t>(val >> 32);
}
// Sets (value true) or clears n bits starting at pixel x.
void fill_bits(uint32_t *row, int64_t x, int64_t n, bool value);
// Copies n bits from src starting at sx to dst starting at dx.
void copy_bits(const uint32_t *src, int64_t sx, uint32_t *dst, int64_t dx, int64_t n);

// ---- conversion ----

// A value in destination units stored into type T: integers round to nearest (halves away
// from zero) and clamp to their range, NaN giving the lowest value; float clamps finite
// values beyond its range to the largest magnitude.
template <class T>
inline T saturate(double v)
{
    if constexpr (std::is_same_v<T, float>) {
        if (v > FLT_MAX && v <= DBL_MAX) return FLT_MAX;
        if (v < -FLT_MAX && v >= -DBL_MAX) return -FLT_MAX;
        return static_cast<float>(v);
    } else if constexpr (std::is_same_v<T, double>) {
        return v;
    } else {
        constexpr double lo = static_cast<double>(std::numeric_limits<T>::lowest());
        constexpr double hi = static_cast<double>(std::numeric_limits<T>::max());
        if (!(v >= lo)) return std::numeric_limits<T>::lowest();
        if (v >= hi) return std::numeric_limits<T>::max();
        return static_cast<T>(v < 0 ? v - 0.5 : v + 0.5);
    }
}


// Converts runs of pixels of one image into another image's format and type, a row segment
// at a time. Values are carried in double, which holds every pixel type exactly.
class RowConverter {
public:
    // Converts between the two records' formats and types (colour to grey by luminance, grey
    // to colour by repetition, full-scale alpha where the source has none, BGR order kept).
    // The pair must have passed check_conversion.
    RowConverter(const Plx_Image *source, const Plx_Image *dest);
    // Takes only channel `channel` of source into a one-channel dest.
    RowConverter(const Plx_Image *source, uint32_t channel, const Plx_Image *dest);

    // Doubles of scratch that convert() needs for n pixels.
    static constexpr std::size_t scratch_size(std::size_t n) { return 8 * n; }
    // Pixels (sr, sc .. sc+n-1) of source into (dr, dc .. dc+n-1) of dest.
    void convert(const Plx_Image *source, int32_t sr, int32_t sc, Plx_Image *dest, int32_t dr,
                 int32_t dc, int32_t n, double *scratch) const;

private:
    struct Op {
        int8_t kind;    // 0 copy channel src, 1 luminance of r, g, b, 2 constant
        int8_t src, r, g, b;
        double value;   // the constant, in source units
    };
    using UnpackFn = void (*)(const void *row, int32_t col, int32_t n, uint32_t channels, double *out);
    using PackFn = void (*)(const double *in, double num, double den, int32_t n, uint32_t channels,
                            void *row, int32_t col);
    void set_types(Plx_PixelType st, Plx_PixelType dt);

    UnpackFn unpack_ = nullptr;
    PackFn pack_ = nullptr;
    double num_ = 1.0, den_ = 1.0;  // source units to destination units: * num_ / den_
    uint32_t src_channels_ = 0, dst_channels_ = 0;
    bool identity_ = false;  // channel i of the result is channel i of the source
    Op op_[4] = {};
};

// copy_window_converted (image_internal.hpp) is the whole-window form of RowConverter.

}  // namespace plx

#endif
