// The per-frame driver: a known shift tracked end to end, progress within the caller's
// limits, interrupts, tracks with nothing to optimise, and results always handed back in
// calibrated coordinates.
#include <gtest/gtest.h>

#include <cmath>
#include <vector>

#include "plano/track.h"
#include "plano_host/host.h"

namespace {

constexpr double kFocal = 100.0;

// A smooth texture with detail at several scales, sampled with the frame shifted by (dx, dy).
Plx_Image *textured_frame(int32_t h, int32_t w, double dx, double dy)
{
    Plx_Image *image = plx_image_form_gen_gl_f(nullptr, h, w);
    for (int32_t r = 0; r < h; ++r)
        for (int32_t c = 0; c < w; ++c) {
            const double x = c - dx, y = r - dy;
            static_cast<float *>(plx_image_row(image, r))[c] =
                float(0.5 + 0.2 * std::sin(0.31 * x + 0.17 * y) + 0.15 * std::cos(0.23 * y - 0.11 * x) +
                      0.1 * std::sin(0.05 * x * y / 8.0));
        }
    return image;
}

Plx_Image *rect_mask(int32_t height, int32_t width, Plx_Window w)
{
    Plx_Image *mask = plx_image_form_gen_b(nullptr, height, width);
    plx_image_fill_zero(mask);
    const double one = 1.0;
    plx_image_fill_const_window(mask, w, &one);
    return mask;
}

struct Scene {
    Plx_Image *previous = textured_frame(64, 80, 0, 0);
    Plx_Image *current = textured_frame(64, 80, 2, 1);  // content moved 2 right, 1 down
    Plx_Image *mask = rect_mask(64, 80, Plx_Window{30, 22, 21, 21});
    Plx_Camera camera{};
    Track *track = nullptr;
    PlanoHost *host = plano_host_new(2);
    Scene()
    {
        plx_camera_build_linear(&camera, 1.0, kFocal, kFocal, 40, 32);
        track = pTrackNew(previous, &camera, current, &camera, 2, nullptr);
    }
    ~Scene()
    {
        vTrackFree(track);
        plx_image_free(previous);
        plx_image_free(current);
        plx_image_free(mask);
        plano_host_free(host);
    }
    TrackRegion *add(uint32_t correlation_size = 16, Plx_Image *valid = nullptr)
    {
        const Plx_Matrix33 identity{{{1, 0, 0}, {0, 1, 0}, {0, 0, 1}}};
        return pTrackRegion(track, mask, previous, &camera, nullptr, valid, &identity, nullptr, nullptr, 0.0,
                            correlation_size, 0.0, 0.0, 1.0, 4, 4, TRACK_MODEL_TRANSLATE, 0.5, 0.0, 0.0, 10, 0.0, 0,
                            0.0, 1, 0.0, 4, 0.01, 0.0, 9.0, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr,
                            nullptr, nullptr, nullptr, nullptr);
    }
};

Plx_Matrix33 motion(const TrackRegion *region)
{
    Plx_Matrix33 h{};
    EXPECT_TRUE(bTrackMotionRead(region, &h));
    return h;
}

TEST(TrackDriver, FollowsAKnownShiftInCalibratedCoordinates)
{
    Scene s;
    TrackRegion *region = s.add();
    ASSERT_NE(region, nullptr);
    ASSERT_TRUE(bTrackOptimise(s.track, 20, 0.001, 10.0, plano_host_interface(s.host)));
    EXPECT_EQ(region->status, TRACK_REGION_OK);
    const Plx_Matrix33 h = motion(region);
    // Equal cameras: a shift of (2, 1) pixels is (2, 1) / f in calibrated units.
    EXPECT_NEAR(h.m[0][2], 2.0 / kFocal, 0.05 / kFocal);
    EXPECT_NEAR(h.m[1][2], 1.0 / kFocal, 0.05 / kFocal);
    EXPECT_EQ(h.m[0][0], 1.0);
    EXPECT_EQ(h.m[2][2], 1.0);
    EXPECT_EQ(region->in_window_pixels, 0u);
    // The information is in calibrated units too: pixels scale by f, information by f^2.
    const Plx_SquMatrix *info = psmTrackInfmatRead(region);
    ASSERT_NE(info, nullptr);
    EXPECT_GT(plx_squmat_get(info, 0, 0), 0.0);
}

TEST(TrackDriver, EmptyTrackAndNothingToOptimiseSucceed)
{
    Scene s;
    EXPECT_TRUE(bTrackOptimise(s.track, 5, 0.001, 10.0, nullptr));
    // A region that is wholly out of view (no valid pixel) gets status 6; the optimiser is
    // skipped and the homography comes back as it went in.
    Plx_Image *nothing_valid = plx_image_form_gen_b(nullptr, 64, 80);
    plx_image_fill_zero(nothing_valid);
    TrackRegion *region = s.add(TRACK_NO_CORRELATION, nothing_valid);
    ASSERT_NE(region, nullptr);
    EXPECT_TRUE(bTrackOptimise(s.track, 5, 0.001, 10.0, nullptr));
    EXPECT_EQ(region->status, TRACK_REGION_OUT_OF_VIEW);
    const Plx_Matrix33 h = motion(region);
    for (int i = 0; i < 3; ++i)
        for (int j = 0; j < 3; ++j) EXPECT_NEAR(h.m[i][j], i == j ? 1.0 : 0.0, 1e-12);
    plx_image_free(nothing_valid);
    EXPECT_FALSE(bTrackOptimise(nullptr, 5, 0.001, 10.0, nullptr));
}

TEST(TrackDriver, ProgressStaysWithinTheCallersLimits)
{
    Scene s;
    ASSERT_NE(s.add(), nullptr);
    ASSERT_NE(s.add(), nullptr);
    std::vector<int32_t> reports;
    plano_host_set_progress_callback(
        s.host, [](void *user, int32_t p) { static_cast<std::vector<int32_t> *>(user)->push_back(p); }, &reports);
    vTrackSetStatusTimeLimits(s.track, 0.5, 1.0);
    ASSERT_TRUE(bTrackOptimise(s.track, 5, 0.001, 10.0, plano_host_interface(s.host)));
    ASSERT_FALSE(reports.empty());
    EXPECT_GE(reports.front(), 49);
    for (int32_t p : reports) {
        EXPECT_GE(p, 49);
        EXPECT_LE(p, 99);
    }
}

TEST(TrackDriver, InterruptReturnsSuccessWithCalibratedResults)
{
    Scene s;
    TrackRegion *region = s.add();
    ASSERT_NE(region, nullptr);
    plano_host_request_interrupt(s.host, 1);
    ASSERT_TRUE(bTrackOptimise(s.track, 20, 0.001, 10.0, plano_host_interface(s.host)));
    EXPECT_EQ(region->in_window_pixels, 0u);
    // At most the coarse search ran: whole pixels of motion, in calibrated units (window
    // pixels would show the search range of 4 in the translation).
    const Plx_Matrix33 h = motion(region);
    EXPECT_LE(std::fabs(h.m[0][2]) * kFocal, 3.0 + 1e-9);
    EXPECT_LE(std::fabs(h.m[1][2]) * kFocal, 3.0 + 1e-9);
    EXPECT_NEAR(h.m[0][2] * kFocal, std::round(h.m[0][2] * kFocal), 1e-9);
}

TEST(TrackDriver, FailingCoarseSearchLosesEveryRegion)
{
    Scene s;
    TrackRegion *a = s.add(), *b = s.add();
    ASSERT_TRUE(a && b);
    ThreadHostInterface table;
    plano_host_fill(s.host, &table);
    // The host's correlation replaces the engine's; this one always fails.
    table.correlation = [](const ThreadHostInterface *, const Plx_Image *, const Plx_Image *, const Plx_Image *,
                           const Plx_Image *, double, Plx_Image *, StatusTime *, double) -> Plx_Image * {
        plx_err_flush_trace();
        plx_err_register_fileline("host_correlation", PLX_ERROR_THREAD, "test", 1, "", 0);
        return nullptr;
    };
    EXPECT_FALSE(bTrackOptimise(s.track, 5, 0.001, 10.0, &table));
    Plx_ErrorRecord origin{};
    ASSERT_TRUE(plx_err_get_error(0, &origin));
    EXPECT_EQ(origin.code, PLX_ERROR_THREAD);  // the trace still starts at the host's failure
    EXPECT_EQ(a->status, TRACK_REGION_LOST);
    EXPECT_EQ(b->status, TRACK_REGION_LOST);
    const Plx_Matrix33 h = motion(a);
    EXPECT_EQ(a->in_window_pixels, 0u);
    EXPECT_LE(std::fabs(h.m[0][2]) * kFocal, 3.0 + 1e-9);
}

}  // namespace
