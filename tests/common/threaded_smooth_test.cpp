// Threaded Gaussian smoothing: the separable reference, independence from the job count,
// bands and chunks, interrupts and failures.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cmath>
#include <cstring>
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

TEST_F(Smoothing, SameBitsForAnyNumberOfJobs)
{
    Plx_Image *rgb = plx_image_form_gen_rgb_uc(nullptr, 37, 61);
    Plx_Image *grey = plx_image_form_gen_gl_f(nullptr, 29, 83);
    reference::fill_noise<uint8_t>(rgb, 9);
    reference::fill_noise<float>(grey, 10);
    for (Plx_Image *src : {rgb, grey}) {
        Plx_Image *alone = smooth(nullptr, src, 1.7);  // no host: one job on this thread
        ASSERT_NE(alone, nullptr);
        for (uint32_t jobs : {1u, 2u, 7u, 45u}) {  // 45 jobs: more than the rows of one
            plano_host_set_jobs(host_, jobs);
            Plx_Image *out = smooth(table_, src, 1.7);
            ASSERT_NE(out, nullptr);
            EXPECT_TRUE(same_pixels(out, alone)) << jobs << " jobs";
            plx_image_free(out);
        }
        plx_image_free(alone);
    }
    plx_image_free(rgb);
    plx_image_free(grey);
}

TEST_F(Smoothing, InPlaceAndCallerBuffers)
{
    Plx_Image *src = plx_image_form_gen_rgba_us(nullptr, 12, 17);
    reference::fill_noise<uint16_t>(src, 11);
    Plx_Image *expected = smooth(table_, src, 1.0);
    ASSERT_NE(expected, nullptr);
    Plx_Image dest{}, mid{};  // zeroed records are formed by the call
    ASSERT_EQ(pgiThreadedSmoothImage(table_, src, &dest, 1.0, &mid), &dest);
    EXPECT_TRUE(same_pixels(&dest, expected));
    EXPECT_EQ(mid.format, PLX_FORMAT_RGBA);
    ASSERT_EQ(pgiThreadedSmoothImage(table_, src, src, 1.0, &mid), src);  // in place
    EXPECT_TRUE(same_pixels(src, expected));
    plx_image_free(&dest);
    plx_image_free(&mid);
    plx_image_free(expected);
    plx_image_free(src);
}

TEST_F(Smoothing, BandsAreWorkedInChunksAndAnInterruptStopsEarly)
{
    // 21 rows in one band are worked in chunks of 10, 10 and 1; 15 columns in 10 and 5. The
    // interrupt query is asked after every chunk.
    const int rows = 21, cols = 15;
    Plx_Image *src = plx_image_form_gen_gl_f(nullptr, rows, cols);
    reference::fill_noise<float>(src, 12);
    plano_host_set_jobs(host_, 1);
    ThreadHostInterface table;
    plano_host_fill(host_, &table);
    CountingInterrupt counter;
    table.callback_context = &counter;
    table.interrupt = count_interrupts;
    Plx_Image *full = pgiThreadedSmoothImage(&table, src, nullptr, 1.0, nullptr);
    ASSERT_NE(full, nullptr);
    EXPECT_EQ(counter.calls.load(), 3 + 2);

    // Stop after the second chunk of rows: row 20 of the intermediate is never written, and
    // the column pass stops after its first chunk.
    const float sentinel = -7.0f;
    Plx_Image *mid = plx_image_form_gen_gl_f(nullptr, rows, cols);
    Plx_Image *dest = plx_image_form_gen_gl_f(nullptr, rows, cols);
    for (Plx_Image *im : {mid, dest})
        for (int y = 0; y < rows; ++y)
            for (int x = 0; x < cols; ++x) *reference::at<float>(im, y, x, 0) = sentinel;
    counter.calls = 0;
    counter.stop_at = 2;
    ASSERT_EQ(pgiThreadedSmoothImage(&table, src, dest, 1.0, mid), dest);  // success
    EXPECT_EQ(counter.calls.load(), 2 + 1);
    for (int x = 0; x < cols; ++x) {
        EXPECT_NE(*reference::at<float>(mid, 19, x, 0), sentinel);
        EXPECT_EQ(*reference::at<float>(mid, 20, x, 0), sentinel);
    }
    for (int y = 0; y < rows; ++y) {
        EXPECT_NE(*reference::at<float>(dest, y, 9, 0), sentinel);
        EXPECT_EQ(*reference::at<float>(dest, y, 10, 0), sentinel);
    }

    // The host's own interrupt flag, set from anywhere, ends the call with success too.
    plano_host_request_interrupt(host_, 1);
    EXPECT_EQ(pgiThreadedSmoothImage(table_, src, dest, 1.0, mid), dest);
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
