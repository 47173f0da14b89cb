// Threaded Gaussian smoothing: the separable reference, the same bits as the library's own
// passes whether the work is fused or split in two, independence from the job count, bands
// and chunks, interrupts and failures.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cmath>
#include <cstring>
#include <string>
#include <vector>

#include "common/reference_convolve.hpp"
#include "thread_test_util.hpp"

using threads_test::last_record;
using threads_test::trace_record;

namespace {

using Smoothing = threads_test::WithHost;

// The separable reference: along x, rounded into the source's type as the intermediate
// image is, then along y, with replicated edges.
template <class T>
std::vector<double> reference_smooth(const Plx_Image *src, double sigma)
{
    const std::vector<double> k = reference::gaussian(sigma);
    Plx_Image *mid = plx_image_form_gen(nullptr, src->format, src->type, src->height, src->width);
    const std::vector<double> x = reference::convolve<T>(src, src, -1, PLX_EDGE_EXTEND, k, false);
    const int channels = int(plx_image_format_channels(src->format));
    for (int y = 0; y < src->height; ++y)
        for (int c = 0; c < src->width; ++c)
            for (int ch = 0; ch < channels; ++ch)
                *reference::at<T>(mid, y, c, ch) = reference::to_type<T>(x[(y * src->width + c) * channels + ch]);
    std::vector<double> out = reference::convolve<T>(mid, mid, -1, PLX_EDGE_EXTEND, k, true);
    plx_image_free(mid);
    return out;
}

// 8-bit smoothing in 16-bit fixed point, lane by lane, with replicated edges.
std::vector<uint8_t> fixed_point_smooth(const Plx_Image *src, double sigma)
{
    const int r = int(4 * sigma), taps = 2 * r + 1;
    Plx_Mask1D *mask = plx_gauss_mask_new(PLX_TYPE_FLOAT, sigma, uint32_t(taps), 1.0);
    std::vector<uint32_t> k(taps);
    for (int t = 0; t < taps; ++t) k[t] = uint32_t(std::lround(double(static_cast<const float *>(mask->data)[t]) * 131072.0));
    plx_mask1D_free(mask);
    const int h = src->height, w = src->width, channels = int(plx_image_format_channels(src->format));
    // One line of n samples at `stride` apart, smoothed into 8-bit levels.
    auto line = [&](auto value, int n, auto store) {
        for (int i = 0; i < n; ++i) {
            auto v = [&](int j) { return uint32_t(value(std::clamp(j, 0, n - 1))) << 7; };
            uint32_t a = uint32_t(r + 1) / 2;
            for (int t = 0; t < r; ++t) a = std::min(a + (((v(i + t - r) + v(i + r - t)) * k[t]) >> 16), 65535u);
            a = std::min(a + ((v(i) * k[r]) >> 16), 65535u);
            store(i, uint8_t((std::min(a, 65407u) + 128) >> 8));
        }
    };
    std::vector<uint8_t> mid(std::size_t(h) * w * channels), out(mid.size());
    for (int y = 0; y < h; ++y)
        for (int ch = 0; ch < channels; ++ch)
            line([&](int x) { return *reference::at<uint8_t>(src, y, x, ch); }, w,
                 [&](int x, uint8_t v) { mid[(std::size_t(y) * w + x) * channels + ch] = v; });
    for (int x = 0; x < w; ++x)
        for (int ch = 0; ch < channels; ++ch)
            line([&](int y) { return mid[(std::size_t(y) * w + x) * channels + ch]; }, h,
                 [&](int y, uint8_t v) { out[(std::size_t(y) * w + x) * channels + ch] = v; });
    return out;
}

bool same_pixels(const Plx_Image *a, const Plx_Image *b)
{
    const std::size_t row = std::size_t(a->width) * plx_image_format_channels(a->format) * plx_image_type_size(a->type);
    for (int y = 0; y < a->height; ++y)
        if (std::memcmp(plx_image_row(a, y), plx_image_row(b, y), row) != 0) return false;
    return true;
}

// Noise in any pixel type.
void fill_any(Plx_Image *im, unsigned seed)
{
    switch (im->type) {
    case PLX_TYPE_UCHAR: reference::fill_noise<uint8_t>(im, seed); break;
    case PLX_TYPE_USHORT: reference::fill_noise<uint16_t>(im, seed); break;
    case PLX_TYPE_INT: reference::fill_noise<int32_t>(im, seed); break;
    case PLX_TYPE_UINT: reference::fill_noise<uint32_t>(im, seed); break;
    case PLX_TYPE_FLOAT: reference::fill_noise<float>(im, seed); break;
    default: reference::fill_noise<double>(im, seed); break;
    }
}

// The library's own passes, one after the other on this thread: along x into `x`, then along
// y into `xy`, with the mask and edge rule smoothing uses. The threaded call, however it
// splits or fuses the work, must give these bits.
struct LibraryPasses {
    Plx_Image *x = nullptr, *xy = nullptr;
    LibraryPasses(const Plx_Image *src, double sigma)
    {
        Plx_Mask1D *mask = plx_gauss_mask_new(PLX_TYPE_FLOAT, sigma, 2 * uint32_t(std::trunc(4 * sigma)) + 1, 1.0);
        x = plx_image_form_gen(nullptr, src->format, src->type, src->height, src->width);
        xy = plx_image_form_gen(nullptr, src->format, src->type, src->height, src->width);
        EXPECT_TRUE(plx_image_convolve1Dx_q(src, -1, PLX_EDGE_EXTEND, mask, x));
        EXPECT_TRUE(plx_image_convolve1Dy_q(x, -1, PLX_EDGE_EXTEND, mask, xy));
        plx_mask1D_free(mask);
    }
    ~LibraryPasses()
    {
        plx_image_free(x);
        plx_image_free(xy);
    }
};

Plx_Image *smooth(const ThreadHostInterface *host, const Plx_Image *src, double sigma)
{
    Plx_Image *out = pgiThreadedSmoothImage(host, src, nullptr, sigma, nullptr);
    EXPECT_NE(out, nullptr);
    return out;
}

// An interrupt query that counts its calls and answers "stop" from call `stop_at` on.
struct CountingInterrupt {
    std::atomic<int> calls{0};
    int stop_at = 1 << 30;
};

int32_t count_interrupts(void *context)
{
    auto *c = static_cast<CountingInterrupt *>(context);
    return ++c->calls >= c->stop_at ? 1 : 0;
}

}  // namespace

TEST_F(Smoothing, MatchesTheSeparableReference)
{
    Plx_Image *f = plx_image_form_gen_gl_f(nullptr, 31, 45);
    reference::fill_noise<float>(f, 7);
    Plx_Image *out = smooth(table_, f, 1.5);
    ASSERT_NE(out, nullptr);
    EXPECT_EQ(out->format, PLX_FORMAT_GREY);
    EXPECT_EQ(out->type, PLX_TYPE_FLOAT);
    EXPECT_EQ(out->owned, 1u);
    std::vector<double> want = reference_smooth<float>(f, 1.5);
    for (int y = 0; y < 31; ++y)
        for (int x = 0; x < 45; ++x) ASSERT_NEAR(*reference::at<float>(out, y, x, 0), want[y * 45 + x], 1e-5);
    plx_image_free(out);
    plx_image_free(f);

    // 8-bit: worked in 16-bit fixed point (values times 128, taps times 2^17, each product of
    // a mirrored pair truncated to 1/256, saturating sums, a bias for the truncations), so the
    // model below must match to the bit.
    Plx_Image *u = plx_image_form_gen_rgb_uc(nullptr, 19, 27);
    reference::fill_noise<uint8_t>(u, 8);
    out = smooth(table_, u, 2.0);
    ASSERT_NE(out, nullptr);
    const std::vector<uint8_t> fixed = fixed_point_smooth(u, 2.0);
    for (int y = 0; y < 19; ++y)
        for (int x = 0; x < 27; ++x)
            for (int ch = 0; ch < 3; ++ch)
                ASSERT_EQ(*reference::at<uint8_t>(out, y, x, ch), fixed[(y * 27 + x) * 3 + ch]) << y << " " << x;
    // and the fixed-point result stays within a level of the exact separable smoothing
    want = reference_smooth<uint8_t>(u, 2.0);
    for (int i = 0; i < 19 * 27 * 3; ++i) ASSERT_LE(std::abs(int(fixed[i]) - reference::to_type<uint8_t>(want[i])), 1);
    plx_image_free(out);
    plx_image_free(u);
}

TEST_F(Smoothing, SameBitsAsTheLibrarysPassesForEveryTypeShapeAndJobCount)
{
    // Float and double are smoothed in one fused pass over bands of rows, each band working
    // its own halo of r rows; the other types in two passes. Shapes: one row, one column,
    // fewer rows than the mask (every output reads the replicated top and bottom rows),
    // exactly as many, and bands of 3 or 4 rows whose halos reach over neighbouring bands.
    // Job counts: none (no host: one job on this thread) up to more jobs than rows. Dest and
    // intermediate come as zeroed records, formed by the call.
    struct Shape {
        int height, width;
        Plx_ImageFormat format;
        double sigma;
    };
    const Shape shapes[] = {
        {1, 23, PLX_FORMAT_GREY, 1.0},     {19, 1, PLX_FORMAT_GREY, 1.0},  {5, 17, PLX_FORMAT_RGBA, 1.5},
        {9, 9, PLX_FORMAT_GREY_ALPHA, 1.0}, {26, 40, PLX_FORMAT_GREY, 1.0}, {14, 29, PLX_FORMAT_VECTOR3D, 0.6},
    };
    const Plx_PixelType types[] = {PLX_TYPE_UCHAR, PLX_TYPE_USHORT, PLX_TYPE_INT,
                                   PLX_TYPE_UINT,  PLX_TYPE_FLOAT,  PLX_TYPE_DOUBLE};
    unsigned seed = 20;
    for (const Shape &shape : shapes)
        for (Plx_PixelType type : types) {
            Plx_Image *src = plx_image_form_gen(nullptr, shape.format, type, shape.height, shape.width);
            fill_any(src, seed++);
            const LibraryPasses want(src, shape.sigma);
            for (uint32_t jobs : {0u, 1u, 2u, 7u, 45u}) {
                if (jobs != 0) plano_host_set_jobs(host_, jobs);
                Plx_Image dest{}, mid{};
                ASSERT_EQ(pgiThreadedSmoothImage(jobs != 0 ? table_ : nullptr, src, &dest, shape.sigma, &mid), &dest);
                const std::string what = std::to_string(shape.height) + "x" + std::to_string(shape.width) +
                                         " format " + std::to_string(shape.format) + " type " +
                                         std::to_string(type) + ", " + std::to_string(jobs) + " jobs";
                EXPECT_TRUE(same_pixels(&dest, want.xy)) << what;
                EXPECT_TRUE(same_pixels(&mid, want.x)) << what << ": intermediate";
                plx_image_free(&dest);
                plx_image_free(&mid);
            }
            plx_image_free(src);
        }
}

TEST_F(Smoothing, ViewsInPlaceAndWideMasksGiveTheSameBits)
{
    // A source that is a window of a larger frame: rows a stride apart wider than the row,
    // starting off any alignment.
    Plx_Image *frame = plx_image_form_gen(nullptr, PLX_FORMAT_RGB, PLX_TYPE_FLOAT, 40, 51);
    reference::fill_noise<float>(frame, 30);
    Plx_Image view{};
    ASSERT_TRUE(plx_image_extract_q(frame, {3, 5, 37, 31}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &view));
    plano_host_set_jobs(host_, 3);
    {
        const LibraryPasses want(&view, 1.2);
        Plx_Image *out = smooth(table_, &view, 1.2);
        ASSERT_NE(out, nullptr);
        EXPECT_TRUE(same_pixels(out, want.xy));
        plx_image_free(out);

        // In place: dest is the source, which the fused pass cannot overwrite as it reads,
        // so the call takes two passes; the bits are the same.
        ASSERT_EQ(pgiThreadedSmoothImage(table_, &view, &view, 1.2, nullptr), &view);
        EXPECT_TRUE(same_pixels(&view, want.xy));
    }
    plx_image_free(&view);
    plx_image_free(frame);

    // dest overlapping the source without being it takes two passes too: rows of one image
    // shifted by one row.
    Plx_Image *tall = plx_image_form_gen(nullptr, PLX_FORMAT_GREY, PLX_TYPE_DOUBLE, 30, 20);
    reference::fill_noise<double>(tall, 31);
    Plx_Image top{}, bottom{};
    ASSERT_TRUE(plx_image_extract_q(tall, {0, 0, 20, 29}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &top));
    ASSERT_TRUE(plx_image_extract_q(tall, {0, 1, 20, 29}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &bottom));
    {
        const LibraryPasses want(&bottom, 1.0);
        ASSERT_EQ(pgiThreadedSmoothImage(table_, &bottom, &top, 1.0, nullptr), &top);
        EXPECT_TRUE(same_pixels(&top, want.xy));
    }
    plx_image_free(&top);
    plx_image_free(&bottom);
    plx_image_free(tall);

    // A mask so wide that its ring of rows would not stay in cache: two passes, same bits.
    Plx_Image *wide = plx_image_form_gen(nullptr, PLX_FORMAT_RGBA, PLX_TYPE_FLOAT, 70, 600);
    reference::fill_noise<float>(wide, 32);
    {
        const LibraryPasses want(wide, 8.0);
        Plx_Image *out = smooth(table_, wide, 8.0);
        ASSERT_NE(out, nullptr);
        EXPECT_TRUE(same_pixels(out, want.xy));
        plx_image_free(out);
    }
    plx_image_free(wide);
}

// A one-job host table whose interrupt query is the counter's.
ThreadHostInterface counting_table(PlanoHost *host, CountingInterrupt *counter)
{
    plano_host_set_jobs(host, 1);
    ThreadHostInterface table;
    plano_host_fill(host, &table);
    table.callback_context = counter;
    table.interrupt = count_interrupts;
    return table;
}

template <class T>
void fill_value(Plx_Image *im, T value)
{
    const int channels = int(plx_image_format_channels(im->format));
    for (int y = 0; y < im->height; ++y)
        for (int x = 0; x < im->width * channels; ++x) static_cast<T *>(plx_image_row(im, y))[x] = value;
}

TEST_F(Smoothing, FusedBandsAreWorkedInChunksAndAnInterruptStopsEarly)
{
    // Float: one pass over a band of 31 output rows in chunks of 10, 10, 10 and 1, the
    // interrupt query asked after each.
    const int rows = 31, cols = 15;
    Plx_Image *src = plx_image_form_gen_gl_f(nullptr, rows, cols);
    reference::fill_noise<float>(src, 12);
    CountingInterrupt counter;
    const ThreadHostInterface table = counting_table(host_, &counter);
    Plx_Image *full = pgiThreadedSmoothImage(&table, src, nullptr, 1.0, nullptr);
    ASSERT_NE(full, nullptr);
    EXPECT_EQ(counter.calls.load(), 4);

    // Stop after the second chunk: output rows 0..19 are done, and the intermediate holds
    // the rows they needed, 0..23 (sigma 1 reaches 4 rows down), and no more.
    const float sentinel = -7.0f;
    Plx_Image *mid = plx_image_form_gen_gl_f(nullptr, rows, cols);
    Plx_Image *dest = plx_image_form_gen_gl_f(nullptr, rows, cols);
    fill_value(mid, sentinel);
    fill_value(dest, sentinel);
    counter.calls = 0;
    counter.stop_at = 2;
    ASSERT_EQ(pgiThreadedSmoothImage(&table, src, dest, 1.0, mid), dest);  // success
    EXPECT_EQ(counter.calls.load(), 2);
    for (int x = 0; x < cols; ++x) {
        EXPECT_EQ(*reference::at<float>(dest, 19, x, 0), *reference::at<float>(full, 19, x, 0));
        EXPECT_EQ(*reference::at<float>(dest, 20, x, 0), sentinel);
        EXPECT_NE(*reference::at<float>(mid, 23, x, 0), sentinel);
        EXPECT_EQ(*reference::at<float>(mid, 24, x, 0), sentinel);
    }

    // The host's own interrupt flag, set from anywhere, ends the call with success too.
    plano_host_request_interrupt(host_, 1);
    EXPECT_EQ(pgiThreadedSmoothImage(table_, src, dest, 1.0, mid), dest);
    for (Plx_Image *im : {src, full, mid, dest}) plx_image_free(im);
}

TEST_F(Smoothing, TwoPassBandsAreWorkedInChunksAndAnInterruptStopsEarly)
{
    // 16-bit: 21 rows in one band are worked in chunks of 10, 10 and 1; 15 columns in 10
    // and 5. The interrupt query is asked after every chunk.
    const int rows = 21, cols = 15;
    const uint16_t sentinel = 65535;
    Plx_Image *src = plx_image_form_gen(nullptr, PLX_FORMAT_GREY, PLX_TYPE_USHORT, rows, cols);
    for (int y = 0; y < rows; ++y)
        for (int x = 0; x < cols; ++x) *reference::at<uint16_t>(src, y, x, 0) = uint16_t(100 + 37 * ((x * 5 + y * 3) % 11));
    CountingInterrupt counter;
    const ThreadHostInterface table = counting_table(host_, &counter);
    Plx_Image *full = pgiThreadedSmoothImage(&table, src, nullptr, 1.0, nullptr);
    ASSERT_NE(full, nullptr);
    EXPECT_EQ(counter.calls.load(), 3 + 2);

    // Stop after the second chunk of rows: row 20 of the intermediate is never written, and
    // the column pass stops after its first chunk.
    Plx_Image *mid = plx_image_form_gen(nullptr, PLX_FORMAT_GREY, PLX_TYPE_USHORT, rows, cols);
    Plx_Image *dest = plx_image_form_gen(nullptr, PLX_FORMAT_GREY, PLX_TYPE_USHORT, rows, cols);
    fill_value(mid, sentinel);
    fill_value(dest, sentinel);
    counter.calls = 0;
    counter.stop_at = 2;
    ASSERT_EQ(pgiThreadedSmoothImage(&table, src, dest, 1.0, mid), dest);  // success
    EXPECT_EQ(counter.calls.load(), 2 + 1);
    for (int x = 0; x < cols; ++x) {
        EXPECT_NE(*reference::at<uint16_t>(mid, 19, x, 0), sentinel);
        EXPECT_EQ(*reference::at<uint16_t>(mid, 20, x, 0), sentinel);
    }
    for (int y = 0; y < rows; ++y) {
        EXPECT_NE(*reference::at<uint16_t>(dest, y, 9, 0), sentinel);
        EXPECT_EQ(*reference::at<uint16_t>(dest, y, 10, 0), sentinel);
    }
    for (Plx_Image *im : {src, full, mid, dest}) plx_image_free(im);
}

TEST_F(Smoothing, BadArgumentsFailAndLeaveTheImagesAlone)
{
    Plx_Image *src = plx_image_form_gen_gl_f(nullptr, 8, 9);
    Plx_Image *dest = plx_image_form_gen_gl_f(nullptr, 3, 3);
    Plx_Image *bits = plx_image_form_gen_b(nullptr, 8, 9);
    reference::fill_noise<float>(src, 13);
    EXPECT_EQ(pgiThreadedSmoothImage(table_, nullptr, dest, 1.0, nullptr), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_ILLEGAL_ARGUMENT);
    EXPECT_EQ(pgiThreadedSmoothImage(table_, bits, dest, 1.0, nullptr), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_ILLEGAL_PIXEL_TYPE);
    EXPECT_EQ(pgiThreadedSmoothImage(table_, src, dest, 0.0, nullptr), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_ILLEGAL_ARGUMENT);
    EXPECT_EQ(dest->height, 3);  // not re-formed by a call that failed its checks
    EXPECT_EQ(pgiThreadedSmoothImage(table_, src, dest, 1.0, dest), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_INCOMPATIBLE);
    Plx_Image view{};
    ASSERT_TRUE(plx_image_extract_q(src, {0, 0, 9, 8}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &view));
    EXPECT_EQ(pgiThreadedSmoothImage(table_, src, dest, 1.0, &view), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_INCOMPATIBLE);
    plx_image_free(&view);
    Plx_Image hollow = *src;  // a record that claims pixels it does not have
    hollow.data = hollow.block = nullptr;
    hollow.owned = 0;
    EXPECT_EQ(pgiThreadedSmoothImage(table_, &hollow, dest, 1.0, nullptr), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_ILLEGAL_ARGUMENT);
    for (Plx_Image *im : {src, dest, bits}) plx_image_free(im);
}

TEST_F(Smoothing, ThreadAndSemaphoreFailuresGiveTheirCodes)
{
    Plx_Image *src = plx_image_form_gen_gl_f(nullptr, 40, 30);
    reference::fill_noise<float>(src, 14);
    plano_host_set_jobs(host_, 3);
    // The second job cannot start: the first is still waited for before the call fails, and
    // the trace keeps the start failure.
    plano_host_fail_thread_creation(host_, 1, PLANO_HOST_FAIL_NEGATIVE_ID);
    EXPECT_EQ(pgiThreadedSmoothImage(table_, src, nullptr, 1.0, nullptr), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_THREAD);
    EXPECT_STREQ(last_record().function, "pgiThreadedSmoothImage");
    EXPECT_STREQ(last_record().message, "Failed to start one or more thread workers");

    plano_host_fail_thread_creation(host_, -1, PLANO_HOST_FAIL_RETURN);
    vThreadedWorkerPoolFree();
    plano_host_fail_semaphore_creation(host_, 0);
    EXPECT_EQ(pgiThreadedSmoothImage(table_, src, nullptr, 1.0, nullptr), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_THREAD);
    EXPECT_STREQ(trace_record(0).function, "pstctThreadedWorkerForm");

    plano_host_fail_semaphore_creation(host_, -1);
    Plx_Image *out = pgiThreadedSmoothImage(table_, src, nullptr, 1.0, nullptr);
    EXPECT_NE(out, nullptr);
    plx_image_free(out);
    plx_image_free(src);
}
