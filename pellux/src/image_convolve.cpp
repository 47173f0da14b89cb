// 1D convolution along rows and columns, and Gaussian masks.
//
// This is the hot path of smoothing and pyramids, so each line is worked in an accumulator
// type (float for 8/16-bit and float pixels, double for the 32-bit integer and double pixels;
// 16-bit fixed point for 8-bit pixels under a Gaussian):
//   along x: each source row is converted once into a padded line with the edge rule
//            applied, and every output value is sum_t k[t] * line[i + t * lanes];
//   along y: each output row is sum_t k[t] * row(y + t - r), the source rows taken straight
//            from the image (float and double, all channels) or converted once into a ring
//            of 2r+1 rows.
// Both are the same kernel (convolve_kernels.hpp), which gives the same bits on every x86-64
// machine whichever instruction set it runs with. Every value goes through the same
// arithmetic whatever its position in the run (a ragged tail is staged through a full vector),
// so results do not depend on the window or band an image is cut into either.
#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <type_traits>

#include "convolve_kernels.hpp"
#include "image_internal.hpp"
#include "pellux/detail/pixel_traits.hpp"
#include "pellux/detail/util.hpp"


#define PLX_INLINE [[gnu::always_inline]] inline

namespace {

using plx::conv::Isa;
using plx::conv::Lanes;
using plx::conv::taps_run;

// Scratch of one convolution call, carved from one heap block.
template <class A>
struct Scratch {
    A *k;               // the mask in the accumulator type
    A *line;            // along x: the padded source line
    A *out;             // one output line before conversion
    A *stage;           // ntaps + 1 vectors for a ragged tail
    const A **src;      // ntaps source pointers (along x: 2 ntaps, the second half for rows read in place)
    const A **stage_src;
    A *ring;            // along y: converted source rows
    int64_t *ring_row;  // the source row held by each ring slot
    A *zero;            // along y: a line of zeros for the zero edge rule
    uint32_t ring_rows;
};

// The kernel over any n with this call's scratch.
template <class A, bool Sym, Isa I, bool Stream = false>
PLX_INLINE void apply_taps(A *out, const A *const *src, uint32_t ntaps, std::size_t n, const Scratch<A> &s)
{
    plx::conv::taps_any<A, Sym, I, Stream>(out, src, s.k, ntaps, n, s.stage, s.stage_src);
}

// ---- pixel conversion ----

// An accumulated value back to a pixel: rounded to nearest (halves away from zero) and
// clamped for integer types, NaN going to the lowest value.
template <class T, class A>
PLX_INLINE T to_pixel(A v)
{
    if constexpr (std::is_same_v<A, uint16_t>) {  // fixed point, units of 1/256; 16-bit lanes
        const uint16_t c = v < 65407 ? v : uint16_t(65407);
        return static_cast<T>(uint16_t(c + 128) >> 8);
    } else if constexpr (!plx::PixelTraits<T>::integral) {
        return static_cast<T>(v);
    } else {
        // Strict comparisons written as selects, so the loops around this vectorise.
        constexpr A lo = static_cast<A>(std::numeric_limits<T>::lowest());
        constexpr A hi = static_cast<A>(std::numeric_limits<T>::max());
        if constexpr (std::is_signed_v<T>) {
            v = v > lo ? v : lo;
            v = v < hi ? v : hi;
            return static_cast<T>(v + (v < A(0) ? A(-0.5) : A(0.5)));
        } else {
            v = v + A(0.5);  // then truncation rounds
            v = v > A(0) ? v : A(0);
            v = v < hi ? v : hi;
            if constexpr (sizeof(T) < 4)
                return static_cast<T>(static_cast<int32_t>(v));
            else
                return static_cast<T>(v);
        }
    }
}

template <class A, class T>
PLX_INLINE A to_accum(T v)
{
    if constexpr (std::is_same_v<A, uint16_t>)
        return static_cast<A>(v << 7);  // fixed point: 8-bit levels times 128
    else
        return static_cast<A>(v);
}

// n pixels of `lanes` values from s (pixel step `step` values) into a flat line d.
template <class T, class A>
PLX_INLINE void load_line(const T *s, std::size_t n, std::size_t lanes, std::size_t step, A *d)
{
    if (lanes == step) {
        const std::size_t m = n * lanes;
        for (std::size_t j = 0; j < m; ++j) d[j] = to_accum<A>(s[j]);
    } else {
        for (std::size_t j = 0; j < n; ++j) d[j] = to_accum<A>(s[j * step]);
    }
}

template <class T, class A>
PLX_INLINE void store_line(const A *s, std::size_t n, std::size_t lanes, std::size_t step, T *d)
{
    if (lanes == step) {
        const std::size_t m = n * lanes;
        for (std::size_t j = 0; j < m; ++j) d[j] = to_pixel<T, A>(s[j]);
    } else {
        for (std::size_t j = 0; j < n; ++j) d[j * step] = to_pixel<T, A>(s[j]);
    }
}

// ---- edges ----

// The source index standing for position p of a line of n samples, or -1 for a zero.
inline int64_t edge_index(int64_t p, int64_t n, Plx_EdgeBehaviour edge)
{
    if (p >= 0 && p < n) return p;
    if (edge == PLX_EDGE_ZERO) return -1;
    if (edge == PLX_EDGE_EXTEND) return p < 0 ? 0 : n - 1;
    if (n == 1) return 0;
    const int64_t period = 2 * (n - 1);  // reflection repeats, for masks wider than the line
    p %= period;
    if (p < 0) p += period;
    return p < n ? p : period - p;
}

// ---- one pass over an image ----

struct Pass {
    const Plx_Image *source;
    Plx_Image *dest;
    uint32_t ntaps;
    std::size_t step;    // values per pixel in the image
    std::size_t lanes;   // values convolved per pixel: step, or 1 for a single channel
    std::size_t offset;  // first convolved value within a pixel
    Plx_EdgeBehaviour edge;
};

template <class T>
PLX_INLINE const T *row_of(const Plx_Image *im, int64_t r, std::size_t offset)
{
    return static_cast<const T *>(plx_image_row(im, static_cast<int32_t>(r))) + offset;
}
template <class T>
PLX_INLINE T *row_of(Plx_Image *im, int64_t r, std::size_t offset)
{
    return static_cast<T *>(plx_image_row(im, static_cast<int32_t>(r))) + offset;
}

template <class T, class A, bool Sym, Isa I>
PLX_INLINE void pass_x(const Pass &p, const Scratch<A> &s)
{
    const int64_t w = p.source->width;
    const int64_t r = p.ntaps / 2;
    const std::size_t lanes = p.lanes, n = std::size_t(w) * lanes;
    const bool direct = std::is_same_v<T, A> && lanes == p.step;
    for (uint32_t t = 0; t < p.ntaps; ++t) s.src[t] = s.line + std::size_t(t) * lanes;
    A *inner = s.line + std::size_t(r) * lanes;
    // Rows the kernel may read in place: outputs whose taps all lie inside the row come
    // straight from it, and only the r pixels at each end go through a padded line. Every
    // value gets the same arithmetic either way.
    if (direct && w > 4 * r) {
        const std::size_t edge = std::size_t(r) * lanes;  // values of r pixels
        const A **row_src = s.src + p.ntaps;
        for (int64_t y = 0; y < p.source->height; ++y) {
            const A *row = reinterpret_cast<const A *>(row_of<T>(p.source, y, p.offset));
            A *o = reinterpret_cast<A *>(row_of<T>(p.dest, y, p.offset));
            for (uint32_t t = 0; t < p.ntaps; ++t) row_src[t] = row + std::size_t(t) * lanes;
            apply_taps<A, Sym, I>(o + edge, row_src, p.ntaps, n - 2 * edge, s);
            // The ends: the line holds pixels -r .. 2r - 1, then w - 2r .. w + r - 1.
            for (int end = 0; end < 2; ++end) {
                const int64_t first = end == 0 ? -r : w - 2 * r;
                for (int64_t q = 0; q < 3 * r; ++q) {
                    const int64_t m = edge_index(first + q, w, p.edge);
                    for (std::size_t c = 0; c < lanes; ++c)
                        s.line[std::size_t(q) * lanes + c] = m < 0 ? A(0) : row[std::size_t(m) * lanes + c];
                }
                apply_taps<A, Sym, I>(s.out, s.src, p.ntaps, edge, s);
                std::memcpy(o + (end == 0 ? 0 : n - edge), s.out, edge * sizeof(A));
            }
        }
        return;
    }
    for (int64_t y = 0; y < p.source->height; ++y) {
        load_line<T, A>(row_of<T>(p.source, y, p.offset), std::size_t(w), lanes, p.step, inner);
        for (int64_t q = -r; q < 0; ++q) {
            A *d = inner + q * int64_t(lanes);
            const int64_t m = edge_index(q, w, p.edge);
            for (std::size_t c = 0; c < lanes; ++c) d[c] = m < 0 ? A(0) : inner[std::size_t(m) * lanes + c];
        }
        for (int64_t q = w; q < w + r; ++q) {
            A *d = inner + q * int64_t(lanes);
            const int64_t m = edge_index(q, w, p.edge);
            for (std::size_t c = 0; c < lanes; ++c) d[c] = m < 0 ? A(0) : inner[std::size_t(m) * lanes + c];
        }
        T *o = row_of<T>(p.dest, y, p.offset);
        if (direct) {
            apply_taps<A, Sym, I>(reinterpret_cast<A *>(o), s.src, p.ntaps, n, s);
        } else {
            apply_taps<A, Sym, I>(s.out, s.src, p.ntaps, n, s);
            store_line<T, A>(s.out, std::size_t(w), lanes, p.step, o);
        }
    }
}

template <class T, class A, bool Sym, Isa I>
PLX_INLINE void pass_y(const Pass &p, const Scratch<A> &s)
{
    const int64_t h = p.source->height, w = p.source->width;
    const int64_t r = p.ntaps / 2;
    const std::size_t lanes = p.lanes, n = std::size_t(w) * lanes;
    const bool direct = std::is_same_v<T, A> && lanes == p.step;
    const std::size_t row_bytes = std::size_t(w) * p.step * sizeof(T);
    constexpr int64_t kAhead = 16;
    // Large float outputs are streamed to memory: they cannot stay in cache anyway, and
    // skipping the read-for-ownership of every line saves a third of the traffic. Small ones
    // (tracker windows, pyramid levels) stay cached for whoever reads them next.
    constexpr std::size_t kStreamBytes = std::size_t(4) << 20;
    const bool streamed = direct && std::is_same_v<A, float> && I == Isa::avx2 &&
                          std::size_t(p.dest->height) * std::size_t(std::abs(p.dest->stride)) >= kStreamBytes;
    for (uint32_t j = 0; j < s.ring_rows; ++j) s.ring_row[j] = -1;
    for (int64_t y = 0; y < h; ++y) {
        // Rows of a narrow column band lie a whole stride apart, which the hardware does not
        // prefetch: ask for the row needed a few output rows from now.
        if (y + r + kAhead < h) {
            const char *ahead = reinterpret_cast<const char *>(row_of<T>(p.source, y + r + kAhead, 0));
            for (std::size_t b = 0; b < row_bytes; b += 64) __builtin_prefetch(ahead + b);
        }
        // Streamed rows (float on AVX2) bypass the cache, so only the others are fetched early.
        if (!streamed && y + kAhead < h) {
            char *ahead = reinterpret_cast<char *>(row_of<T>(p.dest, y + kAhead, 0));
            for (std::size_t b = 0; b < row_bytes; b += 64) __builtin_prefetch(ahead + b, 1);
        }
        for (uint32_t t = 0; t < p.ntaps; ++t) {
            const int64_t m = edge_index(y + t - r, h, p.edge);
            if (m < 0) {
                s.src[t] = s.zero;
            } else if (direct) {
                s.src[t] = reinterpret_cast<const A *>(row_of<T>(p.source, m, 0));
            } else {
                // The rows one output row needs are distinct modulo the ring size, so a row
                // loaded here never evicts another row of the same output row.
                const uint32_t slot = uint32_t(m % s.ring_rows);
                A *line = s.ring + std::size_t(slot) * n;
                if (s.ring_row[slot] != m) {
                    load_line<T, A>(row_of<T>(p.source, m, p.offset), std::size_t(w), lanes, p.step, line);
                    s.ring_row[slot] = m;
                }
                s.src[t] = line;
            }
        }
        T *o = row_of<T>(p.dest, y, p.offset);
        if (streamed) {
            apply_taps<A, Sym, I, true>(reinterpret_cast<A *>(o), s.src, p.ntaps, n, s);
        } else if (direct) {
            apply_taps<A, Sym, I>(reinterpret_cast<A *>(o), s.src, p.ntaps, n, s);
        } else {
            apply_taps<A, Sym, I>(s.out, s.src, p.ntaps, n, s);
            store_line<T, A>(s.out, std::size_t(w), lanes, p.step, o);
        }
    }
#ifdef PLX_CONV_X86
    if (streamed) _mm_sfence();  // the streamed rows are visible before the pass returns
#endif
}

template <class T, class A, bool Sym, bool AlongY, Isa I>
PLX_INLINE void run_pass(const Pass &p, const Scratch<A> &s)
{
    if constexpr (AlongY)
        pass_y<T, A, Sym, I>(p, s);
    else
        pass_x<T, A, Sym, I>(p, s);
}

// The pass compiled once per instruction set (conversions vectorise wider with AVX2); the
// arithmetic is the same in both, products and sums never fused.
template <class T, class A, bool Sym, bool AlongY>
[[PLX_NO_FP_CONTRACT]] void run_pass_baseline(const Pass &p, const Scratch<A> &s)
{
    run_pass<T, A, Sym, AlongY, Isa::baseline>(p, s);
}

#ifdef PLX_CONV_X86
template <class T, class A, bool Sym, bool AlongY>
[[gnu::target("avx2"), PLX_NO_FP_CONTRACT]] void run_pass_avx2(const Pass &p, const Scratch<A> &s)
{
    run_pass<T, A, Sym, AlongY, Isa::avx2>(p, s);
}
#endif

template <class T, class A, bool Sym, bool AlongY>
void dispatch_pass(const Pass &p, const Scratch<A> &s)
{
#ifdef PLX_CONV_X86
    if (plx::conv::machine_isa() == Isa::avx2) {
        run_pass_avx2<T, A, Sym, AlongY>(p, s);
        return;
    }
#endif
    run_pass_baseline<T, A, Sym, AlongY>(p, s);
}

// ---- scratch and the typed entry ----

// Bytes of n objects of T rounded up to a cache line, so every piece stays aligned.
template <class T>
std::size_t piece(std::size_t n)
{
    return (n * sizeof(T) + 63) / 64 * 64;
}

double tap(const Plx_Mask1D *mask, uint32_t t)
{
    return mask->type == PLX_TYPE_FLOAT ? double(static_cast<const float *>(mask->data)[t])
                                        : static_cast<const double *>(mask->data)[t];
}

template <class A>
void mask_values(const Plx_Mask1D *mask, A *k)
{
    for (uint32_t t = 0; t < mask->size; ++t) {
        if constexpr (std::is_same_v<A, uint16_t>)
            k[t] = static_cast<A>(std::lround(tap(mask, t) * 131072.0));
        else if (mask->type == PLX_TYPE_FLOAT)
            k[t] = static_cast<A>(static_cast<const float *>(mask->data)[t]);
        else
            k[t] = static_cast<A>(static_cast<const double *>(mask->data)[t]);
    }
}

// True when 16-bit fixed point suits the mask: symmetric, every tap in [0, 0.5) so that it
// fits 17 fractional bits, and a sum small enough that no sum of products can overflow.
bool fixed_point_suits(const Plx_Mask1D *mask)
{
    double sum = 0;
    for (uint32_t t = 0; t < mask->size; ++t) {
        const double v = tap(mask, t);
        if (!(v >= 0) || std::lround(v * 131072.0) > 65535 || v != tap(mask, mask->size - 1 - t)) return false;
        sum += v;
    }
    return sum <= 1.003;
}

template <class T, class A, bool AlongY>
bool convolve_typed(Pass &p, const Plx_Mask1D *mask, const char *function)
{
    constexpr std::size_t W = Lanes<A>::W;
    const std::size_t ntaps = p.ntaps, r = ntaps / 2;
    const std::size_t w = std::size_t(p.source->width), h = std::size_t(p.source->height);
    const std::size_t n = w * p.lanes;
    const uint32_t ring_rows = AlongY ? uint32_t(std::min<std::size_t>(ntaps, h)) : 0;

    const std::size_t sizes[] = {
        piece<A>(ntaps),
        AlongY ? 0 : piece<A>((w + 2 * r) * p.lanes),
        piece<A>(n),
        piece<A>((ntaps + 1) * W),
        piece<const A *>(AlongY ? ntaps : 2 * ntaps),  // along x: the line's taps, then the row's
        piece<const A *>(ntaps),
        AlongY ? piece<A>(std::size_t(ring_rows) * n) : 0,
        piece<int64_t>(ring_rows),
        AlongY ? piece<A>(n) : 0,
    };
    std::size_t total = 0;
    for (std::size_t z : sizes) total += z;
    plx::HeapPtr<unsigned char> block(static_cast<unsigned char *>(std::aligned_alloc(64, total)));
    if (!block) {
        PLX_ERR_START_AS(function, PLX_ERROR_MALLOC_FAILED, "", static_cast<int64_t>(total));
        return false;
    }
    unsigned char *at = block.get();
    auto take = [&at](std::size_t bytes) {
        unsigned char *q = at;
        at += bytes;
        return q;
    };
    Scratch<A> s;
    s.k = reinterpret_cast<A *>(take(sizes[0]));
    s.line = reinterpret_cast<A *>(take(sizes[1]));
    s.out = reinterpret_cast<A *>(take(sizes[2]));
    s.stage = reinterpret_cast<A *>(take(sizes[3]));
    s.src = reinterpret_cast<const A **>(take(sizes[4]));
    s.stage_src = reinterpret_cast<const A **>(take(sizes[5]));
    s.ring = reinterpret_cast<A *>(take(sizes[6]));
    s.ring_row = reinterpret_cast<int64_t *>(take(sizes[7]));
    s.zero = reinterpret_cast<A *>(take(sizes[8]));
    s.ring_rows = ring_rows;
    if (AlongY) std::fill(s.zero, s.zero + n, A(0));
    mask_values(mask, s.k);

    if constexpr (std::is_same_v<A, uint16_t>) {
        dispatch_pass<T, A, true, AlongY>(p, s);  // chosen only for symmetric masks
        return true;
    }
    bool symmetric = true;
    for (std::size_t t = 0; t < r; ++t) symmetric = symmetric && s.k[t] == s.k[ntaps - 1 - t];
    if (symmetric)
        dispatch_pass<T, A, true, AlongY>(p, s);
    else
        dispatch_pass<T, A, false, AlongY>(p, s);
    return true;
}

// Byte span [lo, hi) covered by an image's rows.
void pixel_span(const Plx_Image *im, uintptr_t *lo, uintptr_t *hi)
{
    const uintptr_t base = reinterpret_cast<uintptr_t>(im->data);
    const intptr_t last = static_cast<intptr_t>(im->height - 1) * im->stride;
    const uintptr_t row = static_cast<uintptr_t>(im->width) * plx_image_format_channels(im->format) *
                          plx_image_type_size(im->type);
    *lo = last < 0 ? base + last : base;
    *hi = (last < 0 ? base : base + last) + row;
}

bool check_convolution(const Plx_Image *source, int32_t channel, Plx_EdgeBehaviour edge,
                       const Plx_Mask1D *mask, const Plx_Image *dest, const char *function)
{
    if (source == nullptr || dest == nullptr || mask == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT,
                         source == nullptr ? "null source" : dest == nullptr ? "null dest" : "null mask", 0);
        return false;
    }
    if (mask->type != PLX_TYPE_FLOAT && mask->type != PLX_TYPE_DOUBLE) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "mask must be float or double", mask->type);
        return false;
    }
    if (mask->size % 2 == 0 || mask->data == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "mask needs an odd size and values", mask->size);
        return false;
    }
    if (edge != PLX_EDGE_ZERO && edge != PLX_EDGE_EXTEND && edge != PLX_EDGE_REFLECT) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_TYPE, "unknown edge behaviour", edge);
        return false;
    }
    if (!plx::check_format_type(source->format, source->type, function)) return false;
    if (source->format == PLX_FORMAT_POINTER) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_FORMAT, "pointer images cannot be convolved", source->format);
        return false;
    }
    if (source->type == PLX_TYPE_BIT) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "bit images cannot be convolved", source->type);
        return false;
    }
    if (dest->format != source->format || dest->type != source->type ||
        dest->width != source->width || dest->height != source->height) {
        PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "source and dest differ in format, type or size", 0);
        return false;
    }
    if (channel >= static_cast<int32_t>(plx_image_format_channels(source->format))) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "no such channel", channel);
        return false;
    }
    if (source->width < 0 || source->height < 0) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "negative image size", 0);
        return false;
    }
    if (source->width == 0 || source->height == 0) return true;
    if (source->data == nullptr || dest->data == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "image without pixels", 0);
        return false;
    }
    uintptr_t slo, shi, dlo, dhi;
    pixel_span(source, &slo, &shi);
    pixel_span(dest, &dlo, &dhi);
    if (slo < dhi && dlo < shi) {
        PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "source and dest share pixels", 0);
        return false;
    }
    return true;
}

template <bool AlongY>
Plx_Bool convolve(const Plx_Image *source, int32_t channel, Plx_EdgeBehaviour edge,
                  const Plx_Mask1D *mask, Plx_Image *dest, const char *function)
{
    if (!check_convolution(source, channel, edge, mask, dest, function)) return 0;
    if (source->width == 0 || source->height == 0) return 1;
    const std::size_t step = plx_image_format_channels(source->format);
    const bool one = channel >= 0 && step > 1;
    Pass p{source, dest, mask->size, step, one ? 1 : step, one ? std::size_t(channel) : 0, edge};
    bool ok = true;
    plx::dispatch_numeric_type(source->type, [&](auto tag) {
        using T = decltype(tag);
        if constexpr (std::is_same_v<T, uint8_t>) {
            if (fixed_point_suits(mask)) {
                ok = convolve_typed<T, uint16_t, AlongY>(p, mask, function);
                return;
            }
        }
        ok = convolve_typed<T, typename plx::PixelTraits<T>::Accum, AlongY>(p, mask, function);
    });
    return ok ? 1 : 0;
}

}  // namespace

extern "C" {

PLX_API Plx_Mask1D *plx_gauss_mask_new(Plx_PixelType type, double sigma, uint32_t size, double scale)
{
    if (type != PLX_TYPE_FLOAT && type != PLX_TYPE_DOUBLE) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "mask must be float or double", type);
        return nullptr;
    }
    if (!(sigma > 0) || size % 2 == 0 || !std::isfinite(scale)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "needs sigma > 0, an odd size and a finite scale", size);
        return nullptr;
    }
    plx::HeapPtr<Plx_Mask1D> mask(PLX_ALLOC(Plx_Mask1D, 1));
    if (!mask) return nullptr;
    const std::size_t bytes = std::size_t(size) * plx_image_type_size(type);
    void *data = PLX_ALLOC(unsigned char, bytes);
    if (data == nullptr) return nullptr;
    const int64_t r = size / 2;
    const double denom = 2.0 * sigma * sigma;
    double sum = 0;
    for (int64_t i = -r; i <= r; ++i) sum += std::exp(-double(i * i) / denom);
    const double norm = scale / sum;
    for (int64_t i = -r; i <= r; ++i) {
        const double v = std::exp(-double(i * i) / denom) * norm;
        if (type == PLX_TYPE_FLOAT)
            static_cast<float *>(data)[i + r] = static_cast<float>(v);
        else
            static_cast<double *>(data)[i + r] = v;
    }
    mask->type = type;
    mask->size = size;
    mask->data = data;
    return mask.release();
}

PLX_API void plx_mask1D_free(Plx_Mask1D *mask)
{
    if (mask == nullptr) return;
    std::free(mask->data);
    std::free(mask);
}

PLX_API Plx_Bool plx_image_convolve1Dx_q(const Plx_Image *source, int32_t channel,
                                         Plx_EdgeBehaviour edge, const Plx_Mask1D *mask,
                                         Plx_Image *dest)
{
    return convolve<false>(source, channel, edge, mask, dest, __func__);
}

PLX_API Plx_Bool plx_image_convolve1Dy_q(const Plx_Image *source, int32_t channel,
                                         Plx_EdgeBehaviour edge, const Plx_Mask1D *mask,
                                         Plx_Image *dest)
{
    return convolve<true>(source, channel, edge, mask, dest, __func__);
}

}  // extern "C"
