// Halving an image: each pixel of the result is the mean of a 2x2 block (bits: their AND).
#include <bit>
#include <cstring>

#include "image_internal.hpp"
#include "image_ops.hpp"
#include "pellux/detail/pixel_traits.hpp"

namespace {

// Sum type of four values and the rounded mean; integers round halves upwards.
template <class T>
struct Mean4 {
    using Sum = std::conditional_t<std::is_floating_point_v<T>, T,
                                   std::conditional_t<std::is_signed_v<T>, int64_t, uint64_t>>;
    static T of(Sum s)
    {
        if constexpr (std::is_floating_point_v<T>)
            return s * T(0.25);
        else
            return static_cast<T>((s + 2) >> 2);  // arithmetic shift: floor((s + 2) / 4)
    }
};

template <class T>
void halve_rows(const Plx_Image *src, Plx_Image *dst)
{
    using M = Mean4<T>;
    using S = typename M::Sum;
    const std::size_t ch = plx_image_format_channels(src->format);
    const std::size_t n = static_cast<std::size_t>(dst->width);
    for (int32_t r = 0; r < dst->height; ++r) {
        const T *a = static_cast<const T *>(plx_image_row(src, 2 * r));
        const T *b = static_cast<const T *>(plx_image_row(src, 2 * r + 1));
        T *d = static_cast<T *>(plx_image_row(dst, r));
        for (std::size_t c = 0; c < n; ++c)
            for (std::size_t k = 0; k < ch; ++k) {
                std::size_t i = 2 * c * ch + k;
                d[c * ch + k] = M::of(S(a[i]) + S(a[i + ch]) + S(b[i]) + S(b[i + ch]));
            }
    }
}

// The even bits of x packed into its low 16 bits.
inline uint32_t even_bits(uint32_t x)
{
    x &= 0x55555555u;
    x = (x | (x >> 1)) & 0x33333333u;
    x = (x | (x >> 2)) & 0x0F0F0F0Fu;
    x = (x | (x >> 4)) & 0x00FF00FFu;
    x = (x | (x >> 8)) & 0x0000FFFFu;
    return x;
}

void halve_bits(const Plx_Image *src, Plx_Image *dst)
{
    const int32_t sw = plx::bit_words(src->width);
    const int32_t dw = plx::bit_words(dst->width);
    if (dw == 0) return;
    const uint32_t tail = plx::bit_tail_mask(dst->width);
    for (int32_t r = 0; r < dst->height; ++r) {
        const uint32_t *a = plx::bit_row(src, 2 * r), *b = plx::bit_row(src, 2 * r + 1);
        uint32_t *d = plx::bit_row(dst, r);
        // Source words 2w and 2w+1 give result word w. Bits past the source width only meet
        // bits past the result width, which the tail mask keeps out.
        auto pair = [&](int32_t w) -> uint32_t {
            if (w >= sw) return 0;
            uint32_t v = a[w] & b[w];
            return even_bits(v & (v >> 1));
        };
        for (int32_t w = 0; w < dw; ++w) {
            uint32_t v = pair(2 * w) | (pair(2 * w + 1) << 16);
            d[w] = w + 1 < dw ? v : (d[w] & ~tail) | (v & tail);
        }
    }
}

}  // namespace

extern "C" {

PLX_API Plx_Image *plx_image_halve_size(const Plx_Image *source, Plx_Image *dest)
{
    if (!plx::check_value_image(source, __func__)) return nullptr;
    if (dest == source) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "dest is the source", 0);
        return nullptr;
    }
    bool made;
    Plx_Image *out = plx::acquire_dest(dest, source->format, source->type, source->height / 2,
                                       source->width / 2, __func__, made);
    if (out == nullptr) return nullptr;
    if (out->height > 0 && out->width > 0) {
        if (source->type == PLX_TYPE_BIT)
            halve_bits(source, out);
        else
            plx::dispatch_numeric_type(source->type, [&](auto tag) { halve_rows<decltype(tag)>(source, out); });
    }
    // Pixel (r, c) covers source pixels (2r, 2c) to (2r+1, 2c+1): the frame offset halves
    // with it, rounding down so odd offsets keep pixels in their coarser cell.
    out->x = source->x >> 1;
    out->y = source->y >> 1;
    return out;
}

}  // extern "C"
