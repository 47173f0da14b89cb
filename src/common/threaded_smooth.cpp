// Gaussian smoothing split over host threads.
//
// Float and double images go through one fused pass: each job takes a band of output rows,
// smooths source rows along x one at a time into a small private ring of rows (which stays
// in cache), and as soon as the ring holds the rows an output row needs, smooths along y from
// the ring into dest. The x-smoothed rows of the band are also written to the intermediate
// image. The r rows above and below a band (its halo) are smoothed along x by the job itself,
// so jobs stay independent and write disjoint rows; every value is worked by the same kernel
// in the same order as by the two separate passes, so the bits do not change.
//
// Other pixel types, rings too large to stay in cache, and a dest that shares pixels with the
// source take two passes: along x in bands of rows, then along y in bands of columns. Rows
// (or columns) of a band are independent in the direction of the convolution, so bands need
// no overlap and jobs write disjoint parts of the output.
#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <type_traits>

#include "common/internal.hpp"
#include "common/job_batch.hpp"
#include "plano/threads.h"

// The convolution kernel of the image library, header-only: the fused pass runs exactly the
// arithmetic of the library's own passes.
#include "../../pellux/src/convolve_kernels.hpp"

namespace {

// Byte span [lo, hi) covered by an image's rows; empty images cover nothing.
void pixel_span(const Plx_Image *im, uintptr_t *lo, uintptr_t *hi)
{
    *lo = *hi = 0;
    if (im->data == nullptr || im->width <= 0 || im->height <= 0) return;
    const uintptr_t base = reinterpret_cast<uintptr_t>(im->data);
    const intptr_t last = static_cast<intptr_t>(im->height - 1) * im->stride;
    const uintptr_t row = static_cast<uintptr_t>(im->width) * plx_image_format_channels(im->format) *
                          plx_image_type_size(im->type);
    *lo = last < 0 ? base + last : base;
    *hi = (last < 0 ? base : base + last) + row;
}

bool share_pixels(const Plx_Image *a, const Plx_Image *b)
{
    uintptr_t alo, ahi, blo, bhi;
    pixel_span(a, &alo, &ahi);
    pixel_span(b, &blo, &bhi);
    return alo < ahi && blo < bhi && alo < bhi && blo < ahi;
}

// ---- the fused pass ----

using plx::conv::Isa;
using plx::conv::Lanes;
using plx::conv::taps_run;

// One band of output rows of the fused pass.
struct FusedJob {
    const ThreadHostInterface *host;  // interrupt query checked after each chunk; may be null
    const Plx_Image *source;
    Plx_Image *intermediate;  // receives the band's x-smoothed rows
    Plx_Image *dest;
    const Plx_Mask1D *mask;
    uint32_t ntaps;
    uint32_t first, count;  // output rows [first, first + count)
    bool symmetric;         // mirrored taps are equal: added before one multiply
    Isa isa;
    unsigned char *scratch;  // this job's piece of the call's scratch block
};

// The fused pass gains by reading its ring from the core's own cache; measured on 1080p
// float frames it gains nothing once the ring passes about 200 KB (RGB at sigma 1, grey at
// sigma 6) and loses beyond, so larger rings take two passes.
constexpr std::size_t kFusedRingBytes = std::size_t(256) << 10;
// Nor is a pass worth a scratch block larger than this over all its jobs.
constexpr std::size_t kFusedScratchBytes = std::size_t(64) << 20;
// Outputs at least this large are streamed past the cache (as the library's own passes do):
// they cannot stay cached anyway, and skipping the read-for-ownership saves traffic.
constexpr std::size_t kStreamBytes = std::size_t(4) << 20;

// Bytes of n objects of T rounded up to a cache line, so every piece stays aligned.
template <class T>
constexpr std::size_t piece(std::size_t n)
{
    return (n * sizeof(T) + 63) / 64 * 64;
}

// Layout of one job's scratch for values of type A.
template <class A>
struct FusedScratch {
    A *k;                  // the mask in A
    A *line;               // source pixels with replicated edges, for outputs near the ends
    A *stage;              // ntaps + 1 vectors for a ragged tail
    const A **xsrc;        // tap pointers along x
    const A **ysrc;        // tap pointers along y
    const A **stage_src;   // tap pointers into stage
    A *ring;               // ring_rows x-smoothed rows, pitch values apart
    std::size_t pitch;
    uint32_t ring_rows;

    A *out;                // a narrow row's x-smoothed values, in whole vectors

    // Rows of at least this many values are read in place, but for their ends.
    static std::size_t wide_row(std::size_t edge) { return 2 * edge + 2 * Lanes<A>::W; }
    static std::size_t ring_pitch(std::size_t n) { return piece<A>(n) / sizeof(A); }

    // Bytes of the layout; with `at`, carves it from there.
    static std::size_t layout(std::size_t w, std::size_t lanes, std::size_t h, std::size_t ntaps,
                              FusedScratch *s = nullptr, unsigned char *at = nullptr)
    {
        const std::size_t edge = ntaps / 2 * lanes, n = w * lanes, W = Lanes<A>::W;
        const std::size_t rows = std::min(ntaps, h);
        const std::size_t sizes[] = {piece<A>(ntaps),         piece<A>(4 * edge + 4 * W),
                                     piece<A>((ntaps + 1) * W), piece<const A *>(ntaps),
                                     piece<const A *>(ntaps),   piece<const A *>(ntaps),
                                     rows * piece<A>(n),        piece<A>(2 * edge + 3 * W)};
        std::size_t total = 0;
        for (std::size_t z : sizes) total += z;
        if (s == nullptr) return total;
        auto take = [&at](std::size_t bytes) {
            unsigned char *q = at;
            at += bytes;
            return q;
        };
        s->k = reinterpret_cast<A *>(take(sizes[0]));
        s->line = reinterpret_cast<A *>(take(sizes[1]));
        s->stage = reinterpret_cast<A *>(take(sizes[2]));
        s->xsrc = reinterpret_cast<const A **>(take(sizes[3]));
        s->ysrc = reinterpret_cast<const A **>(take(sizes[4]));
        s->stage_src = reinterpret_cast<const A **>(take(sizes[5]));
        s->ring = reinterpret_cast<A *>(take(sizes[6]));
        s->out = reinterpret_cast<A *>(take(sizes[7]));
        s->pitch = ring_pitch(n);
        s->ring_rows = uint32_t(rows);
        return total;
    }
};

// The kernel over any n with this job's scratch.
template <class A, bool Sym, Isa I, bool Stream = false>
void apply_taps(A *out, const A *const *src, uint32_t ntaps, std::size_t n, const FusedScratch<A> &s)
{
    plx::conv::taps_any<A, Sym, I, Stream>(out, src, s.k, ntaps, n, s.stage, s.stage_src);
}

// Values [a, a + count) of a row of n values, pixels of `lanes` values, with the end pixels
// repeated beyond either end, into line.
template <class A>
void fill_line(const A *row, int64_t a, std::size_t count, int64_t n, int64_t lanes, A *line)
{
    for (std::size_t q = 0; q < count; ++q) {
        const int64_t i = a + int64_t(q);
        line[q] = row[i < 0 ? (i % lanes + lanes) % lanes : i >= n ? n - lanes + (i - n) % lanes : i];
    }
}

// One row of n values (pixels of `lanes`) smoothed along x into o, edges replicated. Outputs
// whose taps all lie inside the row read it in place, in whole vectors; the ends come from
// short lines with the end pixels repeated, also in whole vectors, their first and last
// values overlapping the in-place run (where they give the same bits).
template <class A, bool Sym, Isa I>
void smooth_row_x(const A *row, A *o, std::size_t n, std::size_t lanes, uint32_t ntaps, const FusedScratch<A> &s)
{
    constexpr std::size_t W = Lanes<A>::W;
    const std::size_t edge = (ntaps / 2) * lanes;  // values of r pixels
    auto from_line = [&](int64_t a, std::size_t count) {
        fill_line(row, a, count + 2 * edge, int64_t(n), int64_t(lanes), s.line);
        for (uint32_t t = 0; t < ntaps; ++t) s.xsrc[t] = s.line + std::size_t(t) * lanes;
    };
    if (n < FusedScratch<A>::wide_row(edge)) {
        const std::size_t whole = (n + W - 1) / W * W;
        from_line(-int64_t(edge), whole);
        taps_run<A, Sym, I>(s.out, s.xsrc, s.k, ntaps, whole);
        std::memcpy(o, s.out, n * sizeof(A));
        return;
    }
    const std::size_t inner = (n - 2 * edge) / W * W;
    for (uint32_t t = 0; t < ntaps; ++t) s.xsrc[t] = row + std::size_t(t) * lanes;
    taps_run<A, Sym, I>(o + edge, s.xsrc, s.k, ntaps, inner);
    const std::size_t left = (edge + W - 1) / W * W;
    from_line(-int64_t(edge), left);
    taps_run<A, Sym, I>(o, s.xsrc, s.k, ntaps, left);
    const std::size_t right = (n - inner - edge + W - 1) / W * W;
    from_line(int64_t(n - right - edge), right);
    taps_run<A, Sym, I>(o + n - right, s.xsrc, s.k, ntaps, right);
}

// Copies a row; with `stream`, past the cache where the destination allows.
void copy_row(void *dst, const void *src, std::size_t bytes, bool stream)
{
#ifdef PLX_CONV_X86
    if (stream) {
        auto *d = static_cast<unsigned char *>(dst);
        const auto *q = static_cast<const unsigned char *>(src);
        const std::size_t head = std::min<std::size_t>((16 - (reinterpret_cast<uintptr_t>(d) & 15)) & 15, bytes);
        std::memcpy(d, q, head);
        d += head, q += head, bytes -= head;
        for (; bytes >= 16; d += 16, q += 16, bytes -= 16)
            _mm_stream_si128(reinterpret_cast<__m128i *>(d), _mm_loadu_si128(reinterpret_cast<const __m128i *>(q)));
        std::memcpy(d, q, bytes);
        return;
    }
#endif
    (void)stream;
    std::memcpy(dst, src, bytes);
}

bool is_large(const Plx_Image *im)
{
    return std::size_t(im->height) * std::size_t(std::abs(im->stride)) >= kStreamBytes;
}

template <class A, bool Sym, Isa I>
void fused_band(const FusedJob &job)
{
    const Plx_Image *src = job.source;
    const int64_t h = src->height;
    const std::size_t w = std::size_t(src->width), lanes = plx_image_format_channels(src->format);
    const std::size_t n = w * lanes, ntaps = job.ntaps;
    const int64_t r = int64_t(ntaps / 2);
    FusedScratch<A> s;
    FusedScratch<A>::layout(w, lanes, std::size_t(h), ntaps, &s, job.scratch);
    for (std::size_t t = 0; t < ntaps; ++t) s.k[t] = A(static_cast<const float *>(job.mask->data)[t]);

    const bool stream_mid = is_large(job.intermediate);
    const bool stream_dest = std::is_same_v<A, float> && I == Isa::avx2 && is_large(job.dest);
    const int64_t first = job.first, end = int64_t(job.first) + job.count;
    int64_t next = std::max<int64_t>(0, first - r);  // the next row to smooth along x
    auto ring_row = [&](int64_t m) { return s.ring + std::size_t(m % s.ring_rows) * s.pitch; };

    const uint32_t chunk = std::max(job.count / 20, 10u);
    for (uint32_t done = 0; done < job.count;) {
        const uint32_t rows = std::min(chunk, job.count - done);
        for (int64_t y = first + done; y < first + done + rows; ++y) {
            // The rows y needs, y - r .. y + r with replicated edges, are the last ones
            // smoothed, distinct modulo the ring size.
            for (const int64_t last = std::min(h - 1, y + r); next <= last; ++next) {
                A *x = ring_row(next);
                smooth_row_x<A, Sym, I>(static_cast<const A *>(plx_image_row(src, int32_t(next))), x, n, lanes,
                                        uint32_t(ntaps), s);
                if (next >= first && next < end)
                    copy_row(plx_image_row(job.intermediate, int32_t(next)), x, n * sizeof(A), stream_mid);
            }
            for (std::size_t t = 0; t < ntaps; ++t) s.ysrc[t] = ring_row(std::clamp<int64_t>(y + int64_t(t) - r, 0, h - 1));
            A *o = static_cast<A *>(plx_image_row(job.dest, int32_t(y)));
            if (stream_dest)
                apply_taps<A, Sym, I, true>(o, s.ysrc, uint32_t(ntaps), n, s);
            else
                apply_taps<A, Sym, I>(o, s.ysrc, uint32_t(ntaps), n, s);
        }
        done += rows;
        // An interrupt is not a failure: the job ends with what it has done.
        const ThreadHostInterface *host = job.host;
        if (host != nullptr && host->interrupt != nullptr && host->interrupt(host->callback_context) != 0) break;
    }
#ifdef PLX_CONV_X86
    if (stream_mid || stream_dest) _mm_sfence();  // streamed rows are visible before the job ends
#endif
}

template <class A>
void fused_typed(const FusedJob &job)
{
#ifdef PLX_CONV_X86
    if (job.isa == Isa::avx2) {
        if (job.symmetric)
            fused_band<A, true, Isa::avx2>(job);
        else
            fused_band<A, false, Isa::avx2>(job);
        return;
    }
#endif
    if (job.symmetric)
        fused_band<A, true, Isa::baseline>(job);
    else
        fused_band<A, false, Isa::baseline>(job);
}

// Job function of the fused pass; its checks were made by the call that formed the record.
Plx_Bool fused_job(void *record)
{
    const auto *job = static_cast<const FusedJob *>(record);
    if (job->source->type == PLX_TYPE_FLOAT)
        fused_typed<float>(*job);
    else
        fused_typed<double>(*job);
    return 1;
}

// Scratch bytes of one fused job, or 0 when the fused pass does not suit the image.
std::size_t fused_scratch_bytes(const Plx_Image *source, uint32_t ntaps)
{
    if (source->type != PLX_TYPE_FLOAT && source->type != PLX_TYPE_DOUBLE) return 0;
    // (An image without pixels is left to the two passes, whose checks report it.)
    if (source->width <= 0 || source->height <= 0 || source->data == nullptr) return 0;
    const std::size_t w = std::size_t(source->width), h = std::size_t(source->height);
    const std::size_t lanes = plx_image_format_channels(source->format), size = plx_image_type_size(source->type);
    const std::size_t rows = std::min<std::size_t>(ntaps, h);
    if (rows * piece<unsigned char>(w * lanes * size) > kFusedRingBytes) return 0;
    return size == sizeof(float) ? FusedScratch<float>::layout(w, lanes, h, ntaps)
                                 : FusedScratch<double>::layout(w, lanes, h, ntaps);
}

// Images and mask made by the call, released on every path.
struct Owned {
    Plx_Mask1D *mask = nullptr;
    Plx_Image *intermediate = nullptr;
    Plx_Image *dest = nullptr;  // released only on failure
    plx::HeapPtr<SmoothingJob> jobs;
    plx::HeapPtr<FusedJob> fused_jobs;
    plx::HeapPtr<unsigned char> scratch;  // every fused job's scratch, one piece each
    std::size_t scratch_piece = 0;       // bytes of one piece; 0: two passes
    plx::HeapPtr<ThreadedWorker *> workers;

    ~Owned()
    {
        plx_mask1D_free(mask);
        plx_image_free(intermediate);
        plx_image_free(dest);
    }
};

// Runs one pass of n jobs; registers the caller's record on failure.
bool run_pass(const ThreadHostInterface *host, const Plx_Image *source, Plx_Image *target,
              uint32_t direction, const Plx_Mask1D *mask, uint32_t n, Owned &owned)
{
    const uint32_t total = uint32_t(direction == 1 ? source->height : source->width);
    for (uint32_t i = 0; i < n; ++i) {
        const plano::Band band = plano::band_of(i, n, total);
        owned.jobs.get()[i] = SmoothingJob{host, source, target, direction, mask, band.first, band.count};
    }
    const plano::JobsResult result = plano::run_jobs(host, gbApplySmoothingToWindow, owned.jobs.get(),
                                                     sizeof(SmoothingJob), n, owned.workers.get());
    if (result == plano::JobsResult::ok) return true;
    plx_err_register_fileline("pgiThreadedSmoothImage", PLX_ERROR_CALLEE, __FILE__, __LINE__,
                              plano::jobs_failure_message(result), 0);
    return false;
}

// Runs the fused pass in n jobs over bands of rows; registers the caller's record on failure.
bool run_fused(const ThreadHostInterface *host, const Plx_Image *source, Plx_Image *intermediate, Plx_Image *dest,
               uint32_t n, Owned &owned)
{
    const Plx_Mask1D *mask = owned.mask;  // float taps: equal as floats, equal as doubles
    const float *k = static_cast<const float *>(mask->data);
    bool symmetric = true;
    for (uint32_t t = 0; t < mask->size / 2; ++t) symmetric = symmetric && k[t] == k[mask->size - 1 - t];
    const Isa isa = plx::conv::machine_isa();
    for (uint32_t i = 0; i < n; ++i) {
        const plano::Band band = plano::band_of(i, n, uint32_t(source->height));
        owned.fused_jobs.get()[i] = FusedJob{host,        source,     intermediate, dest,
                                             mask,        mask->size, band.first,   band.count,
                                             symmetric,   isa,        owned.scratch.get() + i * owned.scratch_piece};
    }
    const plano::JobsResult result =
        plano::run_jobs(host, fused_job, owned.fused_jobs.get(), sizeof(FusedJob), n, owned.workers.get());
    if (result == plano::JobsResult::ok) return true;
    plx_err_register_fileline("pgiThreadedSmoothImage", PLX_ERROR_CALLEE, __FILE__, __LINE__,
                              plano::jobs_failure_message(result), 0);
    return false;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool gbApplySmoothingToWindow(void *job_record)
{
    const auto *job = static_cast<const SmoothingJob *>(job_record);
    if (job == nullptr || job->source == nullptr || job->dest == nullptr || job->mask == nullptr ||
        job->direction > 1) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "incomplete smoothing job", 0);
        return 0;
    }
    const uint32_t chunk = std::max(job->count / 20, 10u);
    // Views of the chunk: zeroed records, so forming a view releases nothing of the caller's.
    Plx_Image source_view{}, dest_view{};
    bool ok = true;
    for (uint32_t done = 0; done < job->count && ok;) {
        const uint32_t n = std::min(chunk, job->count - done);
        const int32_t at = int32_t(job->first + done);
        const Plx_Window window = job->direction == 1 ? Plx_Window{0, at, job->source->width, int32_t(n)}
                                                      : Plx_Window{at, 0, int32_t(n), job->source->height};
        ok = plx_image_extract_q(job->source, window, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &source_view) != nullptr &&
             plx_image_extract_q(job->dest, window, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &dest_view) != nullptr;
        if (ok)
            ok = job->direction == 1
                     ? plx_image_convolve1Dx_q(&source_view, -1, PLX_EDGE_EXTEND, job->mask, &dest_view) != 0
                     : plx_image_convolve1Dy_q(&source_view, -1, PLX_EDGE_EXTEND, job->mask, &dest_view) != 0;
        done += n;
        // An interrupt is not a failure: the job ends with what it has done.
        const ThreadHostInterface *host = job->host;
        if (ok && host != nullptr && host->interrupt != nullptr && host->interrupt(host->callback_context) != 0)
            break;
    }
    plx_image_free(&source_view);
    plx_image_free(&dest_view);
    if (!ok) PLX_ERR_PASS();
    return ok ? 1 : 0;
}

PLANO_API Plx_Image *pgiThreadedSmoothImage(const ThreadHostInterface *host, const Plx_Image *source,
                                            Plx_Image *dest, double sigma, Plx_Image *intermediate)
{
    if (source == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null source", 0);
        return nullptr;
    }
    const uint32_t channels = plx_image_format_channels(source->format);
    if (channels == 0 || source->format == PLX_FORMAT_POINTER || source->format > PLX_FORMAT_VECTOR3D) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_FORMAT, "format cannot be smoothed", source->format);
        return nullptr;
    }
    if (source->type < PLX_TYPE_UCHAR || source->type > PLX_TYPE_DOUBLE) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "pixel type cannot be smoothed", source->type);
        return nullptr;
    }
    if (intermediate != nullptr && (intermediate == source || intermediate == dest)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the intermediate image must be an image of its own", 0);
        return nullptr;
    }
    if (!(sigma > 0) || !(4.0 * sigma < 1073741823.0)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "sigma out of range", 0);
        return nullptr;
    }
    // Everything that can fail before touching the caller's images comes first.
    Owned owned;
    const uint32_t taps = 2 * uint32_t(std::trunc(4.0 * sigma)) + 1;
    owned.mask = plx_gauss_mask_new(PLX_TYPE_FLOAT, sigma, taps, 1.0);
    if (owned.mask == nullptr) {
        PLX_ERR_PASS();
        return nullptr;
    }
    const uint32_t n = plano::job_count(host);
    owned.jobs.reset(PLX_ALLOC(SmoothingJob, n));
    if (!owned.jobs) return nullptr;
    owned.workers.reset(PLX_ALLOC(ThreadedWorker *, n));
    if (!owned.workers) return nullptr;
    // Scratch of the fused pass, used unless dest turns out to share the source's pixels.
    const std::size_t piece_bytes = fused_scratch_bytes(source, taps);
    if (piece_bytes != 0 && piece_bytes <= kFusedScratchBytes / n) {
        owned.fused_jobs.reset(PLX_ALLOC(FusedJob, n));
        if (!owned.fused_jobs) return nullptr;
        owned.scratch.reset(static_cast<unsigned char *>(std::aligned_alloc(64, piece_bytes * n)));
        if (!owned.scratch) {
            PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "", static_cast<int64_t>(piece_bytes * n));
            return nullptr;
        }
        owned.scratch_piece = piece_bytes;
    }

    const Plx_ImageFormat format = source->format;
    const Plx_PixelType type = source->type;
    const int32_t height = source->height, width = source->width;
    if (dest == nullptr) {
        dest = owned.dest = plx_image_form_gen(nullptr, format, type, height, width);
        if (dest == nullptr) {
            PLX_ERR_PASS();
            return nullptr;
        }
    } else if (!plx_image_set_gen(dest, format, type, height, width)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    if (intermediate == nullptr) {
        intermediate = owned.intermediate = plx_image_form_gen(nullptr, format, type, height, width);
        if (intermediate == nullptr) {
            PLX_ERR_PASS();
            return nullptr;
        }
    } else if (!plx_image_set_gen(intermediate, format, type, height, width)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    // dest may be the source itself (the second pass reads only the intermediate), but the
    // intermediate must not overlap either.
    if (share_pixels(intermediate, source) || share_pixels(intermediate, dest)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the intermediate image shares pixels with source or dest", 0);
        return nullptr;
    }
    // The fused pass reads source rows after writing dest rows above them, so a dest that
    // shares the source's pixels takes two passes (the second reads only the intermediate).
    if (owned.scratch_piece != 0 && !share_pixels(dest, source)) {
        if (!run_fused(host, source, intermediate, dest, n, owned)) return nullptr;
    } else if (!run_pass(host, source, intermediate, 1, owned.mask, n, owned) ||
               !run_pass(host, intermediate, dest, 0, owned.mask, n, owned)) {
        return nullptr;
    }
    owned.dest = nullptr;  // the caller's now
    return dest;
}

}  // extern "C"
