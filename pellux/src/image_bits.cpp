// Bit images: word-parallel logic, dilation along rows and columns, counting and the active
// subwindow. Every loop works on whole 32-bit words; only the last word of a row is merged
// under a mask, so bits past the width (the parent's pixels, in a view) are never changed and
// never read as pixels.
#include <algorithm>
#include <bit>
#include <cstring>

#include "image_internal.hpp"
#include "image_ops.hpp"
#include "pellux/detail/util.hpp"

namespace plx {

void fill_bits(uint32_t *row, int64_t x, int64_t n, bool value)
{
    if (n <= 0) return;
    int64_t end = x + n;  // one past the last bit
    int64_t w0 = x >> 5, w1 = (end - 1) >> 5;
    uint32_t first = 0xFFFFFFFFu << (x & 31);
    uint32_t last = 0xFFFFFFFFu >> (31 - ((end - 1) & 31));
    auto apply = [&](int64_t w, uint32_t m) { row[w] = value ? (row[w] | m) : (row[w] & ~m); };
    if (w0 == w1) {
        apply(w0, first & last);
        return;
    }
    apply(w0, first);
    if (w1 > w0 + 1)
        std::memset(row + w0 + 1, value ? 0xFF : 0x00, static_cast<std::size_t>(w1 - w0 - 1) * 4);
    apply(w1, last);
}

void copy_bits(const uint32_t *src, int64_t sx, uint32_t *dst, int64_t dx, int64_t n)
{
    if ((sx & 31) == 0 && (dx & 31) == 0) {
        int64_t full = n >> 5;
        std::memmove(dst + (dx >> 5), src + (sx >> 5), static_cast<std::size_t>(full) * 4);
        if (n & 31)
            put_bits(dst, dx + full * 32, get_bits(src, sx + full * 32, static_cast<int32_t>(n & 31)),
                     static_cast<int32_t>(n & 31));
        return;
    }
    for (int64_t k = 0; k < n; k += 32) {
        int32_t count = n - k < 32 ? static_cast<int32_t>(n - k) : 32;
        put_bits(dst, dx + k, get_bits(src, sx + k, count), count);
    }
}

}  // namespace plx

namespace {

// Writes a computed row of words into a bit row, keeping the bits past the width.
inline void store_row(uint32_t *dst, const uint32_t *words, int32_t nwords, uint32_t tail)
{
    if (nwords == 0) return;
    std::memmove(dst, words, static_cast<std::size_t>(nwords - 1) * 4);
    dst[nwords - 1] = (dst[nwords - 1] & ~tail) | (words[nwords - 1] & tail);
}

// The shared body of the binary logic operations: dest = op(a, b) word by word.
template <class Op>
Plx_Bool bit_logic(const Plx_Image *a, const Plx_Image *b, Plx_Image *dest, const char *fn, Op op)
{
    if (!plx::check_bit_image(a, fn) || !plx::check_bit_image(b, fn)) return 0;
    if (dest == nullptr) {
        PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_ARGUMENT, "null destination", 0);
        return 0;
    }
    if (!plx::check_same_size(a, b, fn)) return 0;
    if (!plx::prepare_dest(dest, PLX_FORMAT_GREY, PLX_TYPE_BIT, a->height, a->width, fn)) return 0;
    const int32_t nw = plx::bit_words(a->width);
    if (nw == 0) return 1;
    const uint32_t tail = plx::bit_tail_mask(a->width);
    for (int32_t r = 0; r < a->height; ++r) {
        const uint32_t *pa = plx::bit_row(a, r), *pb = plx::bit_row(b, r);
        uint32_t *pd = plx::bit_row(dest, r);
        // Word by word in place: dest may be a or b, and each word is read before written.
        for (int32_t w = 0; w + 1 < nw; ++w) pd[w] = op(pa[w], pb[w]);
        uint32_t v = op(pa[nw - 1], pb[nw - 1]);
        pd[nw - 1] = (pd[nw - 1] & ~tail) | (v & tail);
    }
    return 1;
}

// Checks of the single-operand operations (invert, dilations).
bool check_unary(const Plx_Image *a, const Plx_Image *dest, const char *fn)
{
    if (!plx::check_bit_image(a, fn)) return false;
    if (dest == nullptr) {
        PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_ARGUMENT, "null destination", 0);
        return false;
    }
    return true;
}

// t |= t shifted towards higher pixel indices by k bits (pixel c receives pixel c - k).
// Words are visited from the top so every read sees the value before this step.
void or_shift_up(uint32_t *t, int32_t nw, int64_t k)
{
    int64_t q = k >> 5;
    int32_t s = static_cast<int32_t>(k & 31);
    for (int64_t i = nw - 1; i >= q; --i) {
        uint32_t v = t[i - q] << s;
        if (s != 0 && i - q - 1 >= 0) v |= t[i - q - 1] >> (32 - s);
        t[i] |= v;
    }
}

// t |= t shifted towards lower pixel indices by k bits (pixel c receives pixel c + k).
void or_shift_down(uint32_t *t, int32_t nw, int64_t k)
{
    int64_t q = k >> 5;
    int32_t s = static_cast<int32_t>(k & 31);
    for (int64_t i = 0; i + q < nw; ++i) {
        uint32_t v = t[i + q] >> s;
        if (s != 0 && i + q + 1 < nw) v |= t[i + q + 1] << (32 - s);
        t[i] |= v;
    }
}

// Spreads each set bit over the radius following pixels by doubling: after each step every
// bit holds the OR of a run twice as long, so radius r costs about log2(r) passes.
template <class Step>
void spread(int64_t radius, Step step)
{
    int64_t covered = 1;  // length of the run each bit already holds
    while (covered * 2 <= radius + 1) {
        step(covered);
        covered *= 2;
    }
    if (covered < radius + 1) step(radius + 1 - covered);
}

}  // namespace

extern "C" {

PLX_API Plx_Bool plx_image_bit_and_q(const Plx_Image *a, const Plx_Image *b, Plx_Image *dest)
{
    return bit_logic(a, b, dest, __func__, [](uint32_t x, uint32_t y) { return x & y; });
}

PLX_API Plx_Bool plx_image_bit_or_q(const Plx_Image *a, const Plx_Image *b, Plx_Image *dest)
{
    return bit_logic(a, b, dest, __func__, [](uint32_t x, uint32_t y) { return x | y; });
}

PLX_API Plx_Bool plx_image_bit_eor_q(const Plx_Image *a, const Plx_Image *b, Plx_Image *dest)
{
    return bit_logic(a, b, dest, __func__, [](uint32_t x, uint32_t y) { return x ^ y; });
}

PLX_API Plx_Bool plx_image_bit_nand_q(const Plx_Image *a, const Plx_Image *b, Plx_Image *dest)
{
    return bit_logic(a, b, dest, __func__, [](uint32_t x, uint32_t y) { return ~(x & y); });
}

PLX_API Plx_Bool plx_image_bit_andnot_q(const Plx_Image *a, const Plx_Image *b, Plx_Image *dest)
{
    return bit_logic(a, b, dest, __func__, [](uint32_t x, uint32_t y) { return x & ~y; });
}

PLX_API Plx_Bool plx_image_bit_invert_q(const Plx_Image *a, Plx_Image *dest)
{
    return bit_logic(a, a, dest, __func__, [](uint32_t x, uint32_t) { return ~x; });
}

PLX_API Plx_Bool plx_image_bit_dilate_x_q(const Plx_Image *a, uint32_t radius, Plx_Image *dest)
{
    if (!check_unary(a, dest, __func__)) return 0;
    const int32_t nw = plx::bit_words(a->width);
    plx::HeapPtr<uint32_t> row(PLX_ALLOC(uint32_t, static_cast<std::size_t>(nw)));
    if (row == nullptr) return 0;
    if (!plx::prepare_dest(dest, PLX_FORMAT_GREY, PLX_TYPE_BIT, a->height, a->width, __func__)) return 0;
    if (nw == 0) return 1;
    const uint32_t tail = plx::bit_tail_mask(a->width);
    // A radius beyond the width reaches no further pixels.
    const int64_t r_eff = std::min<int64_t>(radius, a->width);
    uint32_t *t = row.get();
    for (int32_t r = 0; r < a->height; ++r) {
        std::memcpy(t, plx::bit_row(a, r), static_cast<std::size_t>(nw) * 4);
        t[nw - 1] &= tail;  // bits past the width are not pixels
        spread(r_eff, [&](int64_t k) { or_shift_up(t, nw, k); });
        spread(r_eff, [&](int64_t k) { or_shift_down(t, nw, k); });
        store_row(plx::bit_row(dest, r), t, nw, tail);
    }
    return 1;
}

PLX_API Plx_Bool plx_image_bit_dilate_y_q(const Plx_Image *a, uint32_t radius, Plx_Image *dest)
{
    if (!check_unary(a, dest, __func__)) return 0;
    const int32_t nw = plx::bit_words(a->width);
    const int32_t h = a->height;
    const std::size_t n = static_cast<std::size_t>(nw) * static_cast<std::size_t>(h);
    plx::HeapPtr<uint32_t> work(PLX_ALLOC(uint32_t, n));
    if (work == nullptr) return 0;
    if (!plx::prepare_dest(dest, PLX_FORMAT_GREY, PLX_TYPE_BIT, a->height, a->width, __func__)) return 0;
    if (n == 0) return 1;
    const uint32_t tail = plx::bit_tail_mask(a->width);
    uint32_t *t = work.get();
    for (int32_t r = 0; r < h; ++r) {
        std::memcpy(t + static_cast<std::size_t>(r) * nw, plx::bit_row(a, r), static_cast<std::size_t>(nw) * 4);
        t[static_cast<std::size_t>(r) * nw + nw - 1] &= tail;
    }
    const int64_t r_eff = std::min<int64_t>(radius, h);
    // Row i |= row i - k, rows visited bottom-up so each reads a row not yet updated.
    spread(r_eff, [&](int64_t k) {
        for (int64_t i = h - 1; i >= k; --i) {
            uint32_t *d = t + i * nw;
            const uint32_t *s = t + (i - k) * nw;
            for (int32_t w = 0; w < nw; ++w) d[w] |= s[w];
        }
    });
    spread(r_eff, [&](int64_t k) {
        for (int64_t i = 0; i + k < h; ++i) {
            uint32_t *d = t + i * nw;
            const uint32_t *s = t + (i + k) * nw;
            for (int32_t w = 0; w < nw; ++w) d[w] |= s[w];
        }
    });
    for (int32_t r = 0; r < h; ++r) store_row(plx::bit_row(dest, r), t + static_cast<std::size_t>(r) * nw, nw, tail);
    return 1;
}

PLX_API uint32_t plx_image_bit_count(const Plx_Image *image)
{
    if (!plx::check_bit_image(image, __func__)) return 0;
    const int32_t nw = plx::bit_words(image->width);
    if (nw == 0) return 0;
    const uint32_t tail = plx::bit_tail_mask(image->width);
    uint64_t count = 0;
    for (int32_t r = 0; r < image->height; ++r) {
        const uint32_t *p = plx::bit_row(image, r);
        for (int32_t w = 0; w + 1 < nw; ++w) count += static_cast<uint64_t>(std::popcount(p[w]));
        count += static_cast<uint64_t>(std::popcount(p[nw - 1] & tail));
    }
    return count > UINT32_MAX ? UINT32_MAX : static_cast<uint32_t>(count);
}

PLX_API Plx_Bool plx_image_get_active_subwindow_b(const Plx_Image *image, Plx_Window *window)
{
    if (!plx::check_bit_image(image, __func__)) return 0;
    if (window == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null window", 0);
        return 0;
    }
    const int32_t nw = plx::bit_words(image->width);
    const uint32_t tail = plx::bit_tail_mask(image->width);
    int64_t x0 = INT64_MAX, x1 = -1;
    int32_t y0 = -1, y1 = -1;
    for (int32_t r = 0; r < image->height; ++r) {
        const uint32_t *p = plx::bit_row(image, r);
        auto word = [&](int32_t w) { return w == nw - 1 ? (p[w] & tail) : p[w]; };
        int32_t first = 0;
        while (first < nw && word(first) == 0) ++first;
        if (first == nw) continue;
        int32_t last = nw - 1;
        while (word(last) == 0) --last;
        x0 = std::min<int64_t>(x0, int64_t{first} * 32 + std::countr_zero(word(first)));
        x1 = std::max<int64_t>(x1, int64_t{last} * 32 + 31 - std::countl_zero(word(last)));
        if (y0 < 0) y0 = r;
        y1 = r;
    }
    *window = y0 < 0 ? Plx_Window{0, 0, 0, 0}
                     : Plx_Window{static_cast<int32_t>(x0), y0, static_cast<int32_t>(x1 - x0 + 1), y1 - y0 + 1};
    return 1;
}

}  // extern "C"
