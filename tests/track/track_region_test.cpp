// Regions of a track: cutting windows out of the frames, the search window, the homography
// in window pixels, smoothing and pyramids with their sharing, constraint points and angles,
// and the failure paths (which must leave the track unchanged and leak nothing).
#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "plano/track.h"
#include "plano_host/host.h"
#include "track_test_util.hpp"

namespace {

using namespace track_test;

// Pixel value encoding its position, so that a misplaced window shows.
uint8_t texture(int32_t r, int32_t c)
{
    return uint8_t((r * 37 + c * 11) & 255);
}

Image grey_frame(int32_t h, int32_t w)
{
    return make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, h, w, [](int32_t r, int32_t c, int) { return texture(r, c); });
}

Plx_Camera linear_camera(double zh = 1.0)
{
    Plx_Camera camera{};
    EXPECT_TRUE(plx_camera_build_linear(&camera, zh, 500, 500, 40, 30));
    return camera;
}

// The forty arguments of pTrackRegion with plain defaults; tests change what they exercise.
struct RegionArgs {
    Plx_Image *previous_mask = nullptr;
    Plx_Image *reference_image = nullptr;  // null: the previous image
    Plx_Camera reference_camera = linear_camera();
    Plx_Image *reference_mask = nullptr;
    Plx_Image *current_valid_mask = nullptr;
    Plx_Matrix33 homography{{{1, 0, 0}, {0, 1, 0}, {0, 0, 1}}};
    const Plx_SquMatrix *information = nullptr;
    const double *intensity = nullptr;
    double smoothing_sigma = 0;
    uint32_t correlation_size = 16;
    double rotation_range = 0, scale_range = 0, rotation_step = 1;
    uint32_t search_y = 3, search_x = 4;
    uint32_t model = TRACK_MODEL_AFFINE;
    double intensity_sigma = 0.01;
    Plx_Image *window_buffer = nullptr, *smoothed_window_buffer = nullptr, *smoothed_template_buffer = nullptr;
    Plx_Image *smoothing_scratch = nullptr;
    Plx_ImagePyramid *search_storage = nullptr, *template_storage = nullptr, *reference_storage = nullptr;
    const ThreadHostInterface *host = nullptr;
};

TrackRegion *add_region(Track *track, const RegionArgs &a)
{
    return pTrackRegion(track, a.previous_mask, a.reference_image ? a.reference_image : track->previous_image,
                        &a.reference_camera, a.reference_mask, a.current_valid_mask, &a.homography, a.information,
                        a.intensity, a.smoothing_sigma, a.correlation_size, a.rotation_range, a.scale_range,
                        a.rotation_step, a.search_y, a.search_x, a.model, 0.5, 0.0, 0.5, 10, 0.0, 1, 0.0, 1, 0.0,
                        8, a.intensity_sigma, 0.0, 9.0, nullptr, nullptr, a.window_buffer,
                        a.smoothed_window_buffer, a.smoothed_template_buffer, a.smoothing_scratch,
                        a.search_storage, a.template_storage, a.reference_storage, a.host);
}

// Two 48 x 64 frames and a track over them, with the mask most tests use.
struct TrackSetup {
    Image previous = grey_frame(48, 64), current = grey_frame(48, 64);
    Image mask = rect_mask(48, 64, 20, 15, 11, 9);
    Plx_Camera camera = linear_camera();
    Track *track = nullptr;
    RegionArgs args;
    explicit TrackSetup(uint32_t levels = 2)
    {
        track = pTrackNew(previous.get(), &camera, current.get(), &camera, levels, nullptr);
        args.previous_mask = mask.get();
    }
    ~TrackSetup() { vTrackFree(track); }
};

void expect_window(const Plx_Window &w, int32_t x, int32_t y, int32_t width, int32_t height)
{
    EXPECT_EQ(w.x, x);
    EXPECT_EQ(w.y, y);
    EXPECT_EQ(w.width, width);
    EXPECT_EQ(w.height, height);
}

// ---- extraction ----

TEST(TrackExtract, BoxesBecomeOddInsideTheImage)
{
    Image image = grey_frame(40, 64);
    struct Case {
        Plx_Window mask;
        Plx_Window expected;
    } cases[] = {
        {{10, 5, 10, 8}, {10, 5, 11, 9}},   // even sizes grow right and down
        {{54, 32, 10, 8}, {53, 31, 11, 9}},  // at the right and bottom edges they grow left and up
        {{3, 4, 7, 5}, {3, 4, 7, 5}},       // odd sizes stay
    };
    for (const Case &c : cases) {
        Image mask = rect_mask(40, 64, c.mask.x, c.mask.y, c.mask.width, c.mask.height);
        Plx_Image window{}, window_mask{};
        Plx_Window box{};
        uint32_t channel = 0;
        ASSERT_TRUE(bExtractRegion(image.get(), mask.get(), nullptr, 1, &channel, &window, &window_mask, &box));
        expect_window(box, c.expected.x, c.expected.y, c.expected.width, c.expected.height);
        EXPECT_EQ(channel, 0u);  // grey: every channel
        ASSERT_EQ(window.width, box.width);
        ASSERT_EQ(window_mask.height, box.height);
        EXPECT_EQ(window.x, box.x);
        EXPECT_EQ(window.y, box.y);
        for (int32_t r = 0; r < box.height; ++r)
            for (int32_t col = 0; col < box.width; ++col) {
                ASSERT_EQ(px(&window, r, col), texture(box.y + r, box.x + col));
                ASSERT_EQ(plx_image_get_bit(&window_mask, r, col), px(mask.get(), box.y + r, box.x + col));
            }
        plx_image_free(&window);
        plx_image_free(&window_mask);
    }
    // Without a mask the whole image is the region; an even-sized image cannot grow.
    Plx_Image window{}, window_mask{};
    Plx_Window box{};
    image->x = 100;  // frame offsets carry into the window's place
    image->y = 7;
    ASSERT_TRUE(bExtractRegion(image.get(), nullptr, nullptr, 0, nullptr, &window, &window_mask, &box));
    EXPECT_EQ(box.width, 64);
    EXPECT_EQ(box.height, 40);
    EXPECT_EQ(window.x, 100);
    EXPECT_EQ(window.y, 7);
    EXPECT_EQ(plx_image_bit_count(&window_mask), 64u * 40u);
    plx_image_free(&window);
    plx_image_free(&window_mask);

    Image empty = rect_mask(40, 64, 0, 0, 0, 0), small = rect_mask(20, 20, 0, 0, 4, 4);
    EXPECT_FALSE(bExtractRegion(image.get(), empty.get(), nullptr, 1, nullptr, &window, &window_mask, &box));
    EXPECT_EQ(origin_code(), 24);
    EXPECT_FALSE(bExtractRegion(image.get(), small.get(), nullptr, 1, nullptr, &window, &window_mask, &box));
    EXPECT_EQ(origin_code(), 7);
}

// An RGB image whose channel c varies with amplitude amp[c] inside the rectangle and the
// other way round outside it.
Image colour_frame(Plx_ImageFormat format, const double amp_inside[3], const double amp_outside[3],
                   Plx_Window inside)
{
    return make(format, PLX_TYPE_FLOAT, 30, 30, [=](int32_t r, int32_t c, int k) {
        const bool in = c >= inside.x && c < inside.x + inside.width && r >= inside.y && r < inside.y + inside.height;
        const int channel = format == PLX_FORMAT_BGR ? 2 - k : k;
        return 0.5 + (in ? amp_inside : amp_outside)[channel] * (((r + c) % 2 == 0) ? 1.0 : -1.0);
    });
}

TEST(TrackExtract, ActiveChannelIsTheMostVariedInsideTheMask)
{
    const Plx_Window inside{5, 6, 9, 7};
    const double outside[3] = {0.0, 0.4, 0.0};  // green varies most outside the region
    Image mask = rect_mask(30, 30, inside.x, inside.y, inside.width, inside.height);
    struct Case {
        double amp[3];
        uint32_t expected;
    } cases[] = {
        {{0.3, 0.1, 0.2}, 1},
        {{0.1, 0.2, 0.3}, 3},
        {{0.3, 0.3, 0.3}, 2},  // ties go to green, then blue
        {{0.1, 0.3, 0.3}, 2},
        {{0.3, 0.1, 0.3}, 3},
    };
    for (Plx_ImageFormat format : {PLX_FORMAT_RGB, PLX_FORMAT_BGR}) {
        for (const Case &c : cases) {
            Image image = colour_frame(format, c.amp, outside, inside);
            uint32_t channel = 0;
            ASSERT_TRUE(bComputeActiveChannel(image.get(), mask.get(), 0, 0, 30, 30, &channel));
            EXPECT_EQ(channel, c.expected) << format;
            // Cutting the region keeps only that channel, as a grey image.
            Plx_Image window{}, window_mask{};
            Plx_Window box{};
            channel = 0;
            ASSERT_TRUE(bExtractRegion(image.get(), mask.get(), nullptr, 1, &channel, &window, &window_mask, &box));
            EXPECT_EQ(channel, c.expected);
            EXPECT_EQ(window.format, PLX_FORMAT_GREY);
            const int k = format == PLX_FORMAT_BGR ? 3 - int(c.expected) : int(c.expected) - 1;
            EXPECT_EQ(px(&window, 2, 3), px(image.get(), box.y + 2, box.x + 3, k));
            plx_image_free(&window);
            plx_image_free(&window_mask);
        }
    }
    const double amp[3] = {0.3, 0.1, 0.1};
    Image image = colour_frame(PLX_FORMAT_RGB, amp, outside, inside);
    Image empty = rect_mask(30, 30, 0, 0, 0, 0), grey = grey_frame(10, 10);
    uint32_t channel = 0;
    ASSERT_TRUE(bComputeActiveChannel(image.get(), empty.get(), 0, 0, 30, 30, &channel));
    EXPECT_EQ(channel, 2u);  // no pixels: green
    ASSERT_TRUE(bComputeActiveChannel(image.get(), nullptr, 6, 5, 7, 9, &channel));
    EXPECT_EQ(channel, 1u);  // no mask: the whole window
    EXPECT_TRUE(fails_with(bComputeActiveChannel(image.get(), nullptr, 25, 25, 7, 9, &channel), 32));
    EXPECT_TRUE(fails_with(bComputeActiveChannel(grey.get(), nullptr, 0, 0, 10, 10, &channel), 39));
}

TEST(TrackExtract, DistortedCameraResamplesIntoItsLinearVersion)
{
    Image image = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 60, 80,
                       [](int32_t r, int32_t c, int) { return double(float(0.01 * c + 0.02 * r)); });
    Plx_Camera camera{};
    ASSERT_TRUE(plx_camera_build_radial_1(&camera, 1.0, 60, 60, 40, 30, -0.05));
    Image mask = rect_mask(60, 80, 30, 20, 20, 20);
    Plx_Image window{}, window_mask{};
    Plx_Window box{};
    ASSERT_TRUE(bExtractRegion(image.get(), mask.get(), &camera, 1, nullptr, &window, &window_mask, &box));
    // The box covers at least the masked rectangle and stays inside the image.
    EXPECT_LE(box.x, 30);
    EXPECT_LE(box.y, 20);
    EXPECT_GE(box.x + box.width, 50);
    EXPECT_GE(box.y + box.height, 40);
    EXPECT_LE(box.x + box.width, 80);
    EXPECT_EQ(box.width % 2, 1);
    // At the principal point the lens moves nothing: the window shows the image there.
    const int32_t r = 30 - box.y, c = 40 - box.x;
    EXPECT_TRUE(plx_image_get_bit(&window_mask, r, c));
    EXPECT_NEAR(px(&window, r, c), px(image.get(), 30, 40), 1e-4);
    EXPECT_GT(plx_image_bit_count(&window_mask), 200u);
    plx_image_free(&window);
    plx_image_free(&window_mask);
}

// ---- regions ----

TEST(TrackRegion, SearchWindowSurroundsTheRegionAndTheHomographyMovesIntoWindowPixels)
{
    TrackSetup s;
    ASSERT_NE(s.track, nullptr);
    TrackRegion *region = add_region(s.track, s.args);
    ASSERT_NE(region, nullptr);
    EXPECT_EQ(region->template_origin[0], 20);
    EXPECT_EQ(region->template_origin[1], 15);
    EXPECT_EQ(region->region_origin[0], 20);
    // No sweep: the box grown by the search ranges (x 4, y 3).
    EXPECT_EQ(region->search_origin[0], 16);
    EXPECT_EQ(region->search_origin[1], 12);
    const Plx_Image *search = region->search_pyramid->level[0].image;
    EXPECT_EQ(search->width, 11 + 8);
    EXPECT_EQ(search->height, 9 + 6);
    EXPECT_EQ(region->search_pyramid->level[0].mask, nullptr);  // wholly inside, no valid mask
    EXPECT_EQ(px(search, 0, 0), texture(12, 16));
    EXPECT_EQ(px(search, 14, 18), texture(26, 34));
    // Calibrated identity, equal cameras: in window pixels a shift by the search ranges.
    const double expected[3][3] = {{1, 0, 4}, {0, 1, 3}, {0, 0, 1}};
    for (int i = 0; i < 3; ++i)
        for (int j = 0; j < 3; ++j) EXPECT_NEAR(region->homography.m[i][j], expected[i][j], 1e-12);
    // The optimiser's parameter vector is a view of the matrix, not a copy.
    EXPECT_EQ(region->homography_vector.data, &region->homography.m[0][0]);
    EXPECT_EQ(region->information->size, 6u);
    EXPECT_EQ(region->information_given, 0u);
    EXPECT_EQ(region->gain, 1.0);
}

TEST(TrackRegion, SweepWindowCoversTheTurnedAndScaledBox)
{
    TrackSetup s;
    Image mask = rect_mask(48, 64, 25, 18, 11, 11);
    RegionArgs &a = s.args;
    a.previous_mask = mask.get();
    a.rotation_range = 0.3;
    a.scale_range = 0.1;
    a.search_x = 5;
    a.search_y = 2;
    // w' = h' = 12.1, phi = pi/4 > 0.3: 12.1 (sin 0.3 + cos 0.3) = 15.13 -> 15 -> 8 per side.
    TrackRegion *region = add_region(s.track, a);
    ASSERT_NE(region, nullptr);
    EXPECT_EQ(region->search_pyramid->level[0].image->width, 2 * (8 + 5));
    EXPECT_EQ(region->search_pyramid->level[0].image->height, 2 * (8 + 2));
    // Centre pixel (30, 23) sits at half the window size.
    EXPECT_EQ(region->search_origin[0], 30 - 13);
    EXPECT_EQ(region->search_origin[1], 23 - 10);
    // Past phi the diagonal d = 17.11 -> 17 -> 9 per side.
    a.rotation_range = 1.0;
    region = add_region(s.track, a);
    ASSERT_NE(region, nullptr);
    EXPECT_EQ(region->search_pyramid->level[0].image->width, 2 * (9 + 5));
    EXPECT_EQ(region->search_pyramid->level[0].image->height, 2 * (9 + 2));
}

TEST(TrackRegion, ClippedSearchWindowGetsAValidMask)
{
    TrackSetup s;
    Image mask = rect_mask(48, 64, 0, 40, 5, 7);  // bottom-left corner: window leaves the image
    Image given = rect_mask(48, 64, 1, 0, 64 - 1, 45);
    s.args.previous_mask = mask.get();
    s.args.search_x = s.args.search_y = 3;
    // Without a valid mask the frame's extent limits the window; a caller's valid mask is
    // copied where the window lies in the image.
    for (Plx_Image *valid_mask : {static_cast<Plx_Image *>(nullptr), given.get()}) {
        s.args.current_valid_mask = valid_mask;
        TrackRegion *region = add_region(s.track, s.args);
        ASSERT_NE(region, nullptr);
        const Plx_Image *search = region->search_pyramid->level[0].image;
        const Plx_Image *valid = region->search_pyramid->level[0].mask;
        ASSERT_NE(valid, nullptr);
        EXPECT_EQ(region->search_origin[0], -3);
        EXPECT_EQ(region->search_origin[1], 37);
        ASSERT_EQ(search->width, 11);
        ASSERT_EQ(search->height, 13);
        for (int32_t r = 0; r < search->height; ++r)
            for (int32_t c = 0; c < search->width; ++c) {
                const int32_t fr = 37 + r, fc = -3 + c;
                const bool in_frame = fr < 48 && fc >= 0;
                const bool in = valid_mask ? fr < 45 && fc >= 1 : in_frame;
                ASSERT_EQ(plx_image_get_bit(valid, r, c), in ? 1 : 0) << r << " " << c;
                ASSERT_EQ(px(search, r, c), in_frame ? texture(fr, fc) : 0.0);
            }
    }
}

TEST(TrackRegion, DistortedCurrentCameraResamplesTheSearchWindow)
{
    TrackSetup s;
    ASSERT_TRUE(plx_camera_build_radial_1(&s.track->current_camera, 1.0, 60, 60, 32, 24, -0.05));
    Image mask = rect_mask(48, 64, 27, 19, 11, 11);  // centred on the principal point
    s.args.previous_mask = mask.get();
    TrackRegion *region = add_region(s.track, s.args);
    ASSERT_NE(region, nullptr);
    const Plx_Image *search = region->search_pyramid->level[0].image;
    const Plx_Image *valid = region->search_pyramid->level[0].mask;
    ASSERT_NE(valid, nullptr);  // always made through a lens
    const int32_t r = 24 - int32_t(region->search_origin[1]), c = 32 - int32_t(region->search_origin[0]);
    EXPECT_TRUE(plx_image_get_bit(valid, r, c));
    EXPECT_NEAR(px(search, r, c), texture(24, 32), 1.0);
}

TEST(TrackRegion, PyramidsAreSharedWhenTheImagesAre)
{
    {
        TrackSetup s(3);
        Image mask = rect_mask(48, 64, 10, 10, 21, 17);
        s.args.previous_mask = mask.get();
        TrackRegion *region = add_region(s.track, s.args);
        ASSERT_NE(region, nullptr);
        EXPECT_EQ(region->reference_pyramid, region->template_pyramid);
        EXPECT_NE(region->search_pyramid, region->template_pyramid);
        EXPECT_EQ(region->template_pyramid->no_levels, 3u);
        EXPECT_EQ(region->template_pyramid->level[1].image->width, 10);
        EXPECT_EQ(region->template_pyramid->level[2].image->width, 5);
        // A separate reference image gets its own pyramid, cut from its own mask.
        Image reference = grey_frame(48, 64), reference_mask = rect_mask(48, 64, 2, 3, 15, 13);
        s.args.reference_image = reference.get();
        s.args.reference_mask = reference_mask.get();
        region = add_region(s.track, s.args);
        ASSERT_NE(region, nullptr);
        EXPECT_NE(region->reference_pyramid, region->template_pyramid);
        EXPECT_EQ(region->reference_pyramid->level[0].image->width, 15);
        EXPECT_EQ(region->template_origin[0], 2);
        EXPECT_EQ(region->template_position[1], 3u);
        EXPECT_EQ(region->region_origin[0], 10);
        // reference at (2, 3), search window at (6, 7): a shift of (-4, -4) in window pixels,
        // since the region moved from (2, 3) in the reference to (10, 10) under H = identity
        // only through the origins.
        EXPECT_NEAR(region->homography.m[0][2], 2 - 6, 1e-12);
        EXPECT_NEAR(region->homography.m[1][2], 3 - 7, 1e-12);
        EXPECT_EQ(plx_list_get_size(s.track->regions), 2u);
    }
    {
        // One frame against itself: all three pyramids are one.
        Image frame = grey_frame(48, 64), mask = rect_mask(48, 64, 10, 10, 21, 17);
        Plx_Camera camera = linear_camera();
        Track *track = pTrackNew(frame.get(), &camera, frame.get(), &camera, 2, nullptr);
        RegionArgs a;
        a.previous_mask = mask.get();
        TrackRegion *region = add_region(track, a);
        ASSERT_NE(region, nullptr);
        EXPECT_EQ(region->search_pyramid, region->template_pyramid);
        EXPECT_EQ(region->reference_pyramid, region->template_pyramid);
        EXPECT_EQ(region->search_origin[0], region->template_origin[0]);
        EXPECT_NEAR(region->homography.m[0][2], 0.0, 1e-12);
        vTrackFree(track);
    }
}

TEST(TrackRegion, SmoothingAndCallerStorageAreUsedAndNeverFreed)
{
    auto s = std::make_unique<TrackSetup>(2);
    PlanoHost *host = plano_host_new(2);
    Image window_buffer(plx_image_form_gen_gl_uc(nullptr, 0, 0));
    Image smoothed_window(plx_image_form_gen_gl_uc(nullptr, 0, 0));
    Image smoothed_template(plx_image_form_gen_gl_uc(nullptr, 0, 0));
    Plx_ImagePyramid search_storage{}, template_storage{};
    RegionArgs &a = s->args;
    a.smoothing_sigma = 1.5;
    a.window_buffer = window_buffer.get();
    a.smoothed_window_buffer = smoothed_window.get();
    a.smoothed_template_buffer = smoothed_template.get();
    a.search_storage = &search_storage;
    a.template_storage = &template_storage;
    a.host = plano_host_interface(host);
    TrackRegion *region = add_region(s->track, a);
    ASSERT_NE(region, nullptr);
    EXPECT_EQ(region->search_pyramid, &search_storage);
    EXPECT_EQ(region->template_pyramid, &template_storage);
    EXPECT_EQ(search_storage.level[0].image, smoothed_window.get());
    EXPECT_EQ(template_storage.level[0].image, smoothed_template.get());
    EXPECT_EQ(window_buffer->width, 19);
    // Smoothing a window with the same settings directly gives the same pixels.
    Image expected(pgiThreadedSmoothImage(nullptr, window_buffer.get(), nullptr, 1.5, nullptr));
    ASSERT_NE(expected, nullptr);
    for (int32_t r = 0; r < expected->height; ++r)
        for (int32_t c = 0; c < expected->width; ++c)
            ASSERT_EQ(px(expected.get(), r, c), px(smoothed_window.get(), r, c));
    EXPECT_EQ(smoothed_window->x, 16);
    // The template is smoothed with the frame around it, so its border pixels are those of
    // the whole previous frame smoothed, not of its own edges repeated.
    Image whole(pgiThreadedSmoothImage(nullptr, s->previous.get(), nullptr, 1.5, nullptr));
    ASSERT_NE(whole, nullptr);
    const int32_t tx = int32_t(region->template_position[0]), ty = int32_t(region->template_position[1]);
    ASSERT_EQ(smoothed_template->width, 11);
    for (int32_t r = 0; r < smoothed_template->height; ++r)
        for (int32_t c = 0; c < smoothed_template->width; ++c)
            ASSERT_EQ(px(whole.get(), ty + r, tx + c), px(smoothed_template.get(), r, c)) << r << "," << c;
    s.reset();
    // The storage no longer points at the region's windows; the caller's images live on.
    EXPECT_EQ(template_storage.level[0].image, nullptr);
    EXPECT_EQ(window_buffer->width, 19);
    plx_image_pyramid_free(&search_storage);
    plx_image_pyramid_free(&template_storage);
    plano_host_free(host);
}

TEST(TrackRegion, GivenInformationIsScaledAndMovedWithTheHomography)
{
    TrackSetup s;
    RegionArgs &a = s.args;
    a.model = TRACK_MODEL_TRANSLATE;
    a.homography = Plx_Matrix33{{{2, 0, 0.02}, {0, 2, 0.04}, {0, 0, 2}}};  // H22 = 2
    Plx_SquMatrix *info = plx_squmat_new(PLX_SQUMAT_DIAGONAL, 2);
    const double diag[2] = {4.0, 9.0};
    plx_squmat_fill(info, diag);
    a.information = info;
    const double intensity[2] = {1.5, -0.25};
    a.intensity = intensity;
    TrackRegion *region = add_region(s.track, a);
    ASSERT_NE(region, nullptr);
    EXPECT_EQ(region->information_given, 1u);
    // Normalising by H22 = 2 multiplies the information by 4; calibrated to pixels divides by
    // f^2 = 500^2 per axis (translations scale by f); window offsets leave it alone.
    EXPECT_NEAR(plx_squmat_get(region->information, 0, 0), 4.0 * 4.0 / 250000.0, 1e-15);
    EXPECT_NEAR(plx_squmat_get(region->information, 1, 1), 9.0 * 4.0 / 250000.0, 1e-15);
    EXPECT_NEAR(plx_squmat_get(region->information, 0, 1), 0.0, 1e-18);
    // Translation 0.01 calibrated = 5 pixels, plus the search ranges.
    EXPECT_NEAR(region->homography.m[0][2], 5 + 4, 1e-9);
    EXPECT_NEAR(region->homography.m[1][2], 10 + 3, 1e-9);
    EXPECT_EQ(region->gain, 1.5);
    EXPECT_EQ(region->offset, -0.25);
    plx_squmat_free(info);
}

TEST(TrackRegion, FailuresLeaveTheTrackUnchanged)
{
    TrackSetup s;
    const RegionArgs good = s.args;
    ASSERT_NE(add_region(s.track, good), nullptr);

    Image empty = rect_mask(48, 64, 0, 0, 0, 0), small_valid = rect_mask(10, 10, 0, 0, 5, 5);
    Image tiny = rect_mask(48, 64, 20, 15, 1, 1);
    Plx_SquMatrix *wrong = plx_squmat_new(PLX_SQUMAT_SYMMETRIC, 4);
    struct Case {
        const char *what;
        int32_t code;
        std::function<void(RegionArgs &)> change;
        uint32_t levels = 2;
    };
    const Case cases[] = {
        {"negative sigma", 32, [](RegionArgs &a) { a.smoothing_sigma = -1; }},
        {"rotation beyond pi", 32, [](RegionArgs &a) { a.rotation_range = 3.5; }},
        {"negative scale range", 32, [](RegionArgs &a) { a.scale_range = -0.1; }},
        {"unknown model", 12, [](RegionArgs &a) { a.model = 5; }},
        {"affine H22 of 0", 18, [](RegionArgs &a) { a.homography.m[2][2] = 0; }},
        {"empty region mask", 24, [&](RegionArgs &a) { a.previous_mask = empty.get(); }},
        {"information of another model", 7, [&](RegionArgs &a) { a.information = wrong; }},
        {"valid mask of another size", 7, [&](RegionArgs &a) { a.current_valid_mask = small_valid.get(); }},
        {"too many levels for the region", 32, [&](RegionArgs &a) { a.previous_mask = tiny.get(); }, 5},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        std::unique_ptr<TrackSetup> local = c.levels != 2 ? std::make_unique<TrackSetup>(c.levels) : nullptr;
        Track *track = local ? local->track : s.track;
        RegionArgs args = good;
        c.change(args);
        const uint32_t before = plx_list_get_size(track->regions);
        EXPECT_TRUE(fails_with(add_region(track, args), c.code));
        EXPECT_EQ(plx_list_get_size(track->regions), before);
    }
    // A search window wholly outside the current image (placed elsewhere in the frame).
    s.current->x = 1000;
    EXPECT_TRUE(fails_with(add_region(s.track, good), 23));
    EXPECT_EQ(plx_list_get_size(s.track->regions), 1u);
    // ... and partly outside it still works.
    s.current->x = 25;
    EXPECT_NE(add_region(s.track, good), nullptr);
    plx_squmat_free(wrong);
}

TEST(TrackRegion, CorrelationEstimateUsesRegionsThatCorrelate)
{
    TrackSetup s;
    RegionArgs &a = s.args;
    a.search_x = 5, a.search_y = 5;
    ASSERT_NE(add_region(s.track, a), nullptr);
    a.search_x = 10, a.search_y = 4;
    ASSERT_NE(add_region(s.track, a), nullptr);
    a.search_x = 30, a.search_y = 30;
    a.correlation_size = TRACK_NO_CORRELATION;
    ASSERT_NE(add_region(s.track, a), nullptr);
    EXPECT_DOUBLE_EQ(dTrackEstimateCorrTime(s.track), 3 * std::sqrt(40.0) * 0.3);
}

// ---- constraint points and angles ----

TEST(TrackConstraint, PointsJoinTheirRegionsUpToFourEach)
{
    TrackSetup s;
    TrackRegion *r1 = add_region(s.track, s.args);
    TrackRegion *r2 = add_region(s.track, s.args);
    TrackRegion *r3 = add_region(s.track, s.args);
    ASSERT_TRUE(r1 && r2 && r3);
    const double ref[2] = {25, 19}, info[3] = {1, 0, 1}, target[2] = {26, 20};
    TrackConstraintPoint *p1 = pTrackConstraintPoint1Region(s.track, r1, ref, info, target, info);
    ASSERT_NE(p1, nullptr);
    EXPECT_EQ(p1->target_known, 1u);
    EXPECT_EQ(p1->no_regions, 1u);
    EXPECT_EQ(p1->target_point[0], 26);
    TrackConstraintPoint *p2 = pTrackConstraintPoint2Regions(s.track, r1, r2, ref, info, nullptr, nullptr);
    ASSERT_NE(p2, nullptr);
    EXPECT_EQ(p2->target_known, 0u);
    TrackRegion *all[3] = {r1, r2, r3};
    TrackConstraintPoint *p3 = pTrackConstraintPointNRegions(s.track, all, 3, ref, info, target, info);
    ASSERT_NE(p3, nullptr);
    EXPECT_EQ(p3->regions[2], r3);
    EXPECT_EQ(plx_list_get_current(s.track->constraint_points), nullptr);
    EXPECT_EQ(s.track->constraint_points->head->data, p3);  // newest first
    EXPECT_EQ(r1->no_constraint_points, 3u);
    EXPECT_EQ(r1->constraint_points[1], p2);
    EXPECT_EQ(r3->no_constraint_points, 1u);
    ASSERT_NE(pTrackConstraintPoint1Region(s.track, r1, ref, info, target, info), nullptr);
    // A fifth point on r1 is refused and leaves nothing behind.
    EXPECT_TRUE(fails_with(pTrackConstraintPoint2Regions(s.track, r2, r1, ref, info, nullptr, nullptr), 7));
    EXPECT_EQ(plx_list_get_size(s.track->constraint_points), 4u);
    EXPECT_EQ(r2->no_constraint_points, 2u);
    TrackRegion *twice[2] = {r2, r2};
    EXPECT_TRUE(fails_with(pTrackConstraintPointNRegions(s.track, twice, 2, ref, info, nullptr, nullptr), 7));
    TrackRegion stranger{};
    EXPECT_TRUE(fails_with(pTrackConstraintPoint1Region(s.track, &stranger, ref, info, target, info), 7));
    EXPECT_TRUE(fails_with(pTrackConstraintPoint1Region(s.track, r2, ref, info, nullptr, info), 32));
    EXPECT_TRUE(fails_with(pTrackConstraintPointNRegions(s.track, all, 0, ref, info, nullptr, nullptr), 32));

    ASSERT_TRUE(bAngleConstraint(s.track, p1, p2, p3, 0.5, 0.1));
    auto *angle = static_cast<TrackAngleConstraint *>(s.track->angle_constraints->head->data);
    EXPECT_NEAR(angle->information, 100.0, 1e-9);
    EXPECT_EQ(angle->points[1], p2);
    EXPECT_TRUE(fails_with(bAngleConstraint(s.track, p1, p2, p3, 0.5, 0.0), 18));
    TrackConstraintPoint loose{};
    EXPECT_TRUE(fails_with(bAngleConstraint(s.track, p1, &loose, p3, 0.5, 0.1), 7));
    EXPECT_EQ(plx_list_get_size(s.track->angle_constraints), 1u);
}

}  // namespace
