// The correlation stripe, written once over the template's pixel type and channel layout
// and exported under the 18 per-format names.
//
// Loop order: for each output row, every template tap (a template pixel of nonzero weight)
// adds its contribution to the whole row of offsets at once, so the innermost loop runs
// along contiguous search-image rows and vectorises. The search rows a stripe needs are
// first converted to planes of the accumulation type (one per colour channel, plus the sum
// of squares over the channels and, with a search mask, the mask as 0/1), already
// multiplied by the mask so that mixed mask words need no per-bit branch. Whole 32-bit mask
// words are still looked at first: a clear word skips its 32 offsets and a full word sums
// the overlap terms without reading the mask plane.
#include <algorithm>
#include <cmath>
#include <cstring>
#include <mutex>

#include "pellux/detail/pixel_traits.hpp"
#include "plano/track_correlation.h"
#include "track/track_pixels_internal.hpp"

namespace {

using namespace plano::track;

template <class A>
struct Tap {
    int32_t ty, tx;
    A w;      // the pixel's weight
    A wt[3];  // weight times the template value, per colour channel
    A wt2;    // weight times the sum of squared template values
};

// Values are taken in their stored units: scores are ratios, so units never matter.
template <class T, class A>
inline A value_of(T v)
{
    return A(v);
}

void report(const CorrelationJob &job, double increment)
{
    if (job.status_time == nullptr) return;
    const ThreadHostInterface *host = job.host;
    std::mutex *guard = static_cast<std::mutex *>(job.progress_guard);
    if (guard != nullptr) guard->lock();
    vStatusTimeIncrement(job.status_time, increment, host != nullptr ? host->progress : nullptr,
                         host != nullptr ? host->callback_context : nullptr);
    if (guard != nullptr) guard->unlock();
}

bool interrupted(const ThreadHostInterface *host)
{
    return host != nullptr && host->interrupt != nullptr && host->interrupt(host->callback_context) != 0;
}

// The 32 mask bits of row `bits` starting at column x0, limited to `len` bits (1..32).
inline uint32_t mask_run(const uint32_t *bits, int32_t x0, int32_t len, int32_t words)
{
    const int32_t i = x0 >> 5, s = x0 & 31;
    uint32_t v = bits[i] >> s;
    if (s != 0 && i + 1 < words) v |= bits[i + 1] << (32 - s);
    return len >= 32 ? v : v & ((1u << len) - 1u);
}

template <class T, int CS>
bool correlate_stripe(const CorrelationJob &job, const char *name)
{
    using A = typename plx::PixelTraits<T>::Accum;
    constexpr int C = CS == 1 ? 1 : 3;  // colour channels used (alpha ignored)
    const Plx_Image *tpl = job.template_image;
    const Plx_Image *srch = job.search_image;
    const Plx_Image *wimg = job.template_weight;
    const Plx_Image *smask = job.search_mask;
    Plx_Image *out = job.output;
    const int32_t ht = tpl->height, wt = tpl->width;
    const int32_t H = srch->height - ht + 1, W = srch->width - wt + 1;
    const Plx_ImageFormat out_format = smask != nullptr ? PLX_FORMAT_VECTOR2D : PLX_FORMAT_GREY;
    const Plx_PixelType out_type = std::is_same_v<A, float> ? PLX_TYPE_FLOAT : PLX_TYPE_DOUBLE;
    if (out == nullptr || out->format != out_format || out->type != out_type || out->height != H || out->width != W ||
        uint64_t(job.first_row) + job.row_count > uint64_t(H)) {
        PLX_ERR_START_AS(name, PLX_ERROR_INCOMPATIBLE, "the correlation output does not fit the template and search images", 0);
        return false;
    }
    const bool first_stripe = job.first_row == 0 && job.row_count > 0;
    const double row_share = job.time_share * 0.9 / double((H + 1) / 2);
    if (first_stripe) report(job, 0.1 * job.time_share);
    if (job.row_count == 0) return true;

    // Taps: template pixels of nonzero weight, in row-major order.
    plx::HeapPtr<Tap<A>> taps(plx::heap_alloc<Tap<A>>(std::size_t(ht) * std::size_t(wt), name, __FILE__, __LINE__));
    if (!taps) return false;
    std::size_t no_taps = 0;
    A total_weight = 0, norm2 = 0;
    for (int32_t r = 0; r < ht; ++r) {
        const T *t = static_cast<const T *>(plx_image_row(tpl, r));
        const uint32_t *wb = wimg != nullptr && wimg->type == PLX_TYPE_BIT ? bit_row(wimg, r) : nullptr;
        const uint16_t *ws = wimg != nullptr && wimg->type == PLX_TYPE_USHORT
                                 ? static_cast<const uint16_t *>(plx_image_row(wimg, r))
                                 : nullptr;
        for (int32_t c = 0; c < wt; ++c) {
            const A w = wb != nullptr ? A(test_bit(wb, c) ? 1 : 0) : ws != nullptr ? A(ws[c]) : A(1);
            if (w == A(0)) continue;
            Tap<A> &tap = taps.get()[no_taps++];
            tap.ty = r;
            tap.tx = c;
            tap.w = w;
            A sq = 0;
            for (int k = 0; k < 3; ++k) tap.wt[k] = 0;
            for (int k = 0; k < C; ++k) {
                const A v = value_of<T, A>(t[c * CS + k]);
                tap.wt[k] = w * v;
                sq += v * v;
            }
            tap.wt2 = w * sq;
            total_weight += w;
            norm2 += tap.wt2;
        }
    }
    auto zero_rows = [&](uint32_t from) {
        const std::size_t bytes = std::size_t(W) * (smask != nullptr ? 2 : 1) * sizeof(A);
        for (uint32_t i = from; i < job.row_count; ++i)
            std::memset(plx_image_row(out, int32_t(job.first_row + i)), 0, bytes);
    };
    if (total_weight == A(0)) {
        zero_rows(0);
        for (uint32_t i = 0; i < job.row_count; ++i)
            if ((job.first_row + i) % 2 == 1 || job.first_row + i == uint32_t(H - 1)) report(job, row_share);
        return true;
    }

    // Planes of the search rows this stripe reads: rows [first_row, first_row + row_count +
    // ht - 1), all columns. Channel planes (masked), the channel-summed squares (masked) and,
    // with a mask, the mask itself.
    const int32_t ws_ = srch->width;
    const int32_t rows = int32_t(job.row_count) + ht - 1;
    const int planes = C + 1 + (smask != nullptr ? 1 : 0);
    const std::size_t plane_size = std::size_t(rows) * std::size_t(ws_);
    plx::HeapPtr<A> store(plx::heap_alloc<A>(plane_size * std::size_t(planes), name, __FILE__, __LINE__));
    if (!store) return false;
    A *chan[3] = {store.get(), store.get() + plane_size, store.get() + 2 * plane_size};
    A *squares = store.get() + std::size_t(C) * plane_size;
    A *mplane = smask != nullptr ? squares + plane_size : nullptr;
    for (int32_t r = 0; r < rows; ++r) {
        const int32_t sr = int32_t(job.first_row) + r;
        const T *s = static_cast<const T *>(plx_image_row(srch, sr));
        const uint32_t *mb = smask != nullptr ? bit_row(smask, sr) : nullptr;
        const std::size_t o = std::size_t(r) * std::size_t(ws_);
        for (int32_t c = 0; c < ws_; ++c) {
            const A m = mb == nullptr ? A(1) : A(test_bit(mb, c) ? 1 : 0);
            A sq = 0;
            for (int k = 0; k < C; ++k) {
                const A v = value_of<T, A>(s[c * CS + k]) * m;
                chan[k][o + std::size_t(c)] = v;
                sq += v * v;
            }
            squares[o + std::size_t(c)] = sq;
            if (mplane != nullptr) mplane[o + std::size_t(c)] = m;
        }
    }

    const int accs = smask != nullptr ? 4 : 2;
    plx::HeapPtr<A> acc_store(plx::heap_alloc<A>(std::size_t(W) * std::size_t(accs), name, __FILE__, __LINE__));
    if (!acc_store) return false;
    A *__restrict acc_c = acc_store.get();
    A *__restrict acc_q = acc_c + W;
    A *__restrict acc_p = acc_q + W;
    A *__restrict acc_n = acc_p + W;
    const int32_t mask_words = smask != nullptr ? words_of(smask->width) : 0;
    const A norm_t = std::sqrt(norm2);

    for (uint32_t i = 0; i < job.row_count; ++i) {
        const int32_t dy = int32_t(job.first_row + i);
        std::fill(acc_c, acc_c + std::size_t(W) * std::size_t(accs), A(0));
        std::size_t k = 0;
        if constexpr (C == 1) {
            // Unmasked grey: four taps per sweep along the row, so each accumulator is loaded
            // and stored once for four products.
            if (smask == nullptr)
                for (; k + 4 <= no_taps; k += 4) {
                    const Tap<A> *g = taps.get() + k;
                    const A *__restrict a[4];
                    const A *__restrict b[4];
                    for (int j = 0; j < 4; ++j) {
                        const std::size_t o =
                            std::size_t(int32_t(i) + g[j].ty) * std::size_t(ws_) + std::size_t(g[j].tx);
                        a[j] = chan[0] + o;
                        b[j] = squares + o;
                    }
                    const A t0 = g[0].wt[0], t1 = g[1].wt[0], t2 = g[2].wt[0], t3 = g[3].wt[0];
                    const A w0 = g[0].w, w1 = g[1].w, w2 = g[2].w, w3 = g[3].w;
                    const A *__restrict a0 = a[0], *__restrict a1 = a[1], *__restrict a2 = a[2], *__restrict a3 = a[3];
                    const A *__restrict b0 = b[0], *__restrict b1 = b[1], *__restrict b2 = b[2], *__restrict b3 = b[3];
                    for (int32_t dx = 0; dx < W; ++dx) {
                        acc_c[dx] += (t0 * a0[dx] + t1 * a1[dx]) + (t2 * a2[dx] + t3 * a3[dx]);
                        acc_q[dx] += (w0 * b0[dx] + w1 * b1[dx]) + (w2 * b2[dx] + w3 * b3[dx]);
                    }
                }
            else
                for (; k + 4 <= no_taps; k += 4) {
                    // Masked grey, four taps at a time; their mask runs of 32 offsets decide
                    // whether a run is skipped, summed whole, or weighted by the mask plane.
                    const Tap<A> *g = taps.get() + k;
                    const A *__restrict a[4];
                    const A *__restrict b[4];
                    const A *__restrict mp[4];
                    const uint32_t *bits[4];
                    for (int j = 0; j < 4; ++j) {
                        const std::size_t o =
                            std::size_t(int32_t(i) + g[j].ty) * std::size_t(ws_) + std::size_t(g[j].tx);
                        a[j] = chan[0] + o;
                        b[j] = squares + o;
                        mp[j] = mplane + o;
                        bits[j] = bit_row(smask, dy + g[j].ty);
                    }
                    const A t0 = g[0].wt[0], t1 = g[1].wt[0], t2 = g[2].wt[0], t3 = g[3].wt[0];
                    const A w0 = g[0].w, w1 = g[1].w, w2 = g[2].w, w3 = g[3].w;
                    const A p0 = g[0].wt2, p1 = g[1].wt2, p2 = g[2].wt2, p3 = g[3].wt2;
                    const A p_all = (p0 + p1) + (p2 + p3), w_all = (w0 + w1) + (w2 + w3);
                    for (int32_t x0 = 0; x0 < W; x0 += 32) {
                        const int32_t len = std::min(32, W - x0), x1 = x0 + len;
                        const uint32_t all = len >= 32 ? ~0u : (1u << len) - 1u;
                        uint32_t any = 0, every = all;
                        for (int j = 0; j < 4; ++j) {
                            const uint32_t run = mask_run(bits[j], g[j].tx + x0, len, mask_words);
                            any |= run;
                            every &= run;
                        }
                        if (any == 0) continue;  // no tap of the group overlaps this run
                        for (int32_t dx = x0; dx < x1; ++dx) {
                            acc_c[dx] += (t0 * a[0][dx] + t1 * a[1][dx]) + (t2 * a[2][dx] + t3 * a[3][dx]);
                            acc_q[dx] += (w0 * b[0][dx] + w1 * b[1][dx]) + (w2 * b[2][dx] + w3 * b[3][dx]);
                        }
                        if (every == all) {
                            for (int32_t dx = x0; dx < x1; ++dx) {
                                acc_p[dx] += p_all;
                                acc_n[dx] += w_all;
                            }
                        } else {
                            for (int32_t dx = x0; dx < x1; ++dx) {
                                acc_p[dx] += (p0 * mp[0][dx] + p1 * mp[1][dx]) + (p2 * mp[2][dx] + p3 * mp[3][dx]);
                                acc_n[dx] += (w0 * mp[0][dx] + w1 * mp[1][dx]) + (w2 * mp[2][dx] + w3 * mp[3][dx]);
                            }
                        }
                    }
                }
        }
        for (; k < no_taps; ++k) {
            const Tap<A> &tap = taps.get()[k];
            const std::size_t o = std::size_t(int32_t(i) + tap.ty) * std::size_t(ws_) + std::size_t(tap.tx);
            const A *__restrict q = squares + o;
            const A *__restrict s0 = chan[0] + o;
            const A *__restrict s1 = chan[C > 1 ? 1 : 0] + o;
            const A *__restrict s2 = chan[C > 1 ? 2 : 0] + o;
            const A w = tap.w, t0 = tap.wt[0], t1 = tap.wt[1], t2 = tap.wt[2], t2sum = tap.wt2;
            if (smask == nullptr) {
                for (int32_t dx = 0; dx < W; ++dx) {
                    A cv = t0 * s0[dx];
                    if constexpr (C > 1) cv += t1 * s1[dx] + t2 * s2[dx];
                    acc_c[dx] += cv;
                    acc_q[dx] += w * q[dx];
                }
                continue;
            }
            const uint32_t *bits = bit_row(smask, dy + tap.ty);
            const A *__restrict m = mplane + o;
            for (int32_t x0 = 0; x0 < W; x0 += 32) {
                const int32_t len = std::min(32, W - x0);
                const uint32_t run = mask_run(bits, tap.tx + x0, len, mask_words);
                if (run == 0) continue;  // nothing of this run overlaps
                const int32_t x1 = x0 + len;
                const bool full = run == (len >= 32 ? ~0u : (1u << len) - 1u);
                for (int32_t dx = x0; dx < x1; ++dx) {
                    A cv = t0 * s0[dx];
                    if constexpr (C > 1) cv += t1 * s1[dx] + t2 * s2[dx];
                    acc_c[dx] += cv;
                    acc_q[dx] += w * q[dx];
                }
                if (full) {
                    for (int32_t dx = x0; dx < x1; ++dx) {
                        acc_p[dx] += t2sum;
                        acc_n[dx] += w;
                    }
                } else {
                    for (int32_t dx = x0; dx < x1; ++dx) {
                        acc_p[dx] += t2sum * m[dx];
                        acc_n[dx] += w * m[dx];
                    }
                }
            }
        }
        A *o = static_cast<A *>(plx_image_row(out, dy));
        if (smask == nullptr) {
            for (int32_t dx = 0; dx < W; ++dx)
                o[dx] = acc_q[dx] > A(0) && norm_t > A(0) ? acc_c[dx] / norm_t / std::sqrt(acc_q[dx]) : A(0);
        } else {
            for (int32_t dx = 0; dx < W; ++dx) {
                const A pq = acc_p[dx] * acc_q[dx];
                o[2 * dx] = acc_p[dx] > A(0) && acc_q[dx] > A(0) ? acc_c[dx] / std::sqrt(pq) : A(0);
                o[2 * dx + 1] = acc_n[dx] / total_weight;
            }
        }
        if (dy % 2 == 1 || dy == H - 1) report(job, row_share);
        if (interrupted(job.host)) {
            // The rows not computed read as no match rather than as stale memory.
            zero_rows(i + 1);
            break;
        }
    }
    return true;
}

template <class T, int CS>
Plx_Image *run_worker(const CorrelationJob *job, const char *name)
{
    if (job == nullptr || job->template_image == nullptr || job->search_image == nullptr) {
        PLX_ERR_START_AS(name, PLX_ERROR_ILLEGAL_ARGUMENT, "incomplete correlation job", 0);
        return nullptr;
    }
    const Plx_Image *t = job->template_image, *s = job->search_image;
    if (t->type != plx::PixelTraits<T>::code || s->type != t->type || s->format != t->format ||
        int32_t(plx_image_format_channels(t->format)) != CS || s->height < t->height || s->width < t->width ||
        (job->template_weight != nullptr &&
         (job->template_weight->height != t->height || job->template_weight->width != t->width ||
          (job->template_weight->type != PLX_TYPE_BIT && job->template_weight->type != PLX_TYPE_USHORT))) ||
        (job->search_mask != nullptr && !is_mask_of(job->search_mask, s->height, s->width))) {
        PLX_ERR_START_AS(name, PLX_ERROR_INCOMPATIBLE, "the images of the correlation job do not fit its worker", 0);
        return nullptr;
    }
    try {
        return correlate_stripe<T, CS>(*job, name) ? job->output : nullptr;
    } catch (...) {
        PLX_ERR_START_AS(name, PLX_ERROR_CALLEE, "the correlation stripe failed", 0);
        return nullptr;
    }
}

}  // namespace

extern "C" {

#define PLANO_CORRELATION_WORKER(suffix, T, CS)                                                  \
    PLANO_API Plx_Image *pgiImageCorrelate2D_##suffix(const CorrelationJob *job)                \
    {                                                                                            \
        return run_worker<T, CS>(job, __func__);                                                 \
    }
PLANO_CORRELATION_WORKER(gl_i, int32_t, 1)
PLANO_CORRELATION_WORKER(gl_uc, uint8_t, 1)
PLANO_CORRELATION_WORKER(gl_us, uint16_t, 1)
PLANO_CORRELATION_WORKER(gl_ui, uint32_t, 1)
PLANO_CORRELATION_WORKER(gl_f, float, 1)
PLANO_CORRELATION_WORKER(gl_d, double, 1)
PLANO_CORRELATION_WORKER(rgb_i, int32_t, 3)
PLANO_CORRELATION_WORKER(rgb_uc, uint8_t, 3)
PLANO_CORRELATION_WORKER(rgb_us, uint16_t, 3)
PLANO_CORRELATION_WORKER(rgb_ui, uint32_t, 3)
PLANO_CORRELATION_WORKER(rgb_f, float, 3)
PLANO_CORRELATION_WORKER(rgb_d, double, 3)
PLANO_CORRELATION_WORKER(rgba_i, int32_t, 4)
PLANO_CORRELATION_WORKER(rgba_uc, uint8_t, 4)
PLANO_CORRELATION_WORKER(rgba_us, uint16_t, 4)
PLANO_CORRELATION_WORKER(rgba_ui, uint32_t, 4)
PLANO_CORRELATION_WORKER(rgba_f, float, 4)
PLANO_CORRELATION_WORKER(rgba_d, double, 4)
#undef PLANO_CORRELATION_WORKER

PLANO_API Plx_Bool gbApplyCorrelationToWindow(void *job_record)
{
    const auto *job = static_cast<const CorrelationJob *>(job_record);
    if (job == nullptr || job->template_image == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "incomplete correlation job", 0);
        return 0;
    }
    using Worker = Plx_Image *(*)(const CorrelationJob *);
    // Rows: grey, RGB, RGBA; columns: int, uchar, ushort, uint, float, double.
    static const Worker table[3][6] = {
        {pgiImageCorrelate2D_gl_i, pgiImageCorrelate2D_gl_uc, pgiImageCorrelate2D_gl_us, pgiImageCorrelate2D_gl_ui,
         pgiImageCorrelate2D_gl_f, pgiImageCorrelate2D_gl_d},
        {pgiImageCorrelate2D_rgb_i, pgiImageCorrelate2D_rgb_uc, pgiImageCorrelate2D_rgb_us,
         pgiImageCorrelate2D_rgb_ui, pgiImageCorrelate2D_rgb_f, pgiImageCorrelate2D_rgb_d},
        {pgiImageCorrelate2D_rgba_i, pgiImageCorrelate2D_rgba_uc, pgiImageCorrelate2D_rgba_us,
         pgiImageCorrelate2D_rgba_ui, pgiImageCorrelate2D_rgba_f, pgiImageCorrelate2D_rgba_d}};
    int f, t;
    switch (job->template_image->format) {
    case PLX_FORMAT_GREY: f = 0; break;
    case PLX_FORMAT_RGB: f = 1; break;
    case PLX_FORMAT_RGBA: f = 2; break;
    default: PLX_ERR_START(PLX_ERROR_ILLEGAL_FORMAT, "templates are grey, RGB or RGBA", job->template_image->format); return 0;
    }
    switch (job->template_image->type) {
    case PLX_TYPE_INT: t = 0; break;
    case PLX_TYPE_UCHAR: t = 1; break;
    case PLX_TYPE_USHORT: t = 2; break;
    case PLX_TYPE_UINT: t = 3; break;
    case PLX_TYPE_FLOAT: t = 4; break;
    case PLX_TYPE_DOUBLE: t = 5; break;
    default: PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "unsupported template pixel type", job->template_image->type); return 0;
    }
    if (table[f][t](job) != nullptr) return 1;
    PLX_ERR_PASS();
    return 0;
}

}  // extern "C"
