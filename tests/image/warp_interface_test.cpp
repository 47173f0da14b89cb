// The warp's interface: combining cameras, single samples, flow fields, refused input,
// the threaded form, interrupts and progress.
#include <atomic>

#include "failure_check.hpp"
#include "plano_host/host.h"
#include "warp_test_util.hpp"

namespace {

using namespace warp_test;
using plano_test::fails_with;

TEST(ProjectiveWarpCombine, KindsAndMatrices)
{
    Plx_Camera a, b, skewed;
    ASSERT_TRUE(plx_camera_build_linear(&a, 1.0, 100.0, 80.0, 50.0, 40.0));
    ASSERT_TRUE(plx_camera_build_linear(&b, 1.0, 200.0, 160.0, 10.0, 20.0));
    skewed = a;
    skewed.skew = 0.5;
    Plx_Matrix33_f m, mi;
    int32_t kind = -1;
    Plx_Bool identity = 0;
    const Plx_Matrix33 threeI = matrix(3, 0, 0, 0, 3, 0, 0, 0, 3);
    ASSERT_TRUE(bCombineHomogCameras(&a, &threeI, &a, &m, &mi, &kind, &identity));
    EXPECT_EQ(kind, PROJECTIVE_WARP_IDENTITY);
    EXPECT_EQ(identity, 1);
    ASSERT_TRUE(bCombineHomogCameras(&a, &threeI, &skewed, &m, &mi, &kind, &identity));
    EXPECT_NE(kind, PROJECTIVE_WARP_IDENTITY);

    // K_B K_A^-1: x -> 2 (x - 50) + 10, y -> 2 (y - 40) + 20.
    ASSERT_TRUE(bCombineHomogCameras(&a, nullptr, &b, &m, &mi, &kind, &identity));
    EXPECT_EQ(kind, PROJECTIVE_WARP_AFFINE);
    EXPECT_EQ(identity, 0);
    EXPECT_FLOAT_EQ(m.m[0][0], 2.0f);
    EXPECT_FLOAT_EQ(m.m[0][2], -90.0f);
    EXPECT_FLOAT_EQ(m.m[1][2], -60.0f);
    EXPECT_FLOAT_EQ(mi.m[0][0], 0.5f);
    EXPECT_FLOAT_EQ(mi.m[0][2], 45.0f);

    const Plx_Matrix33 P = matrix(1, 0.1, 0.2, 0, 1, 0, 0.3, 0, 1);
    ASSERT_TRUE(bCombineHomogCameras(&a, &P, &b, &m, &mi, &kind, &identity));
    EXPECT_EQ(kind, PROJECTIVE_WARP_PROJECTIVE);
    Plx_Matrix33_f prod;
    plx_mat33f_rmultm33_s(&m, &mi, &prod);
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) EXPECT_NEAR(prod.m[r][c] / prod.m[2][2], r == c ? 1.0 : 0.0, 1e-4);

    const Plx_Matrix33 zero = matrix(0, 0, 0, 0, 0, 0, 0, 0, 0);
    EXPECT_TRUE(fails_with(bCombineHomogCameras(&a, &zero, &b, &m, &mi, &kind, &identity), PLX_ERROR_DIVISION_BY_ZERO));
}

TEST(ProjectiveWarpPixel, SingleSamplesAndTheirFailures)
{
    Image src = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 4, 4, 10, 0);
    const double p00[3] = {0, 100, 255}, p10[3] = {255, 100, 0};
    plx_image_set_pixel(src.get(), 1, 1, p00);
    plx_image_set_pixel(src.get(), 1, 2, p10);
    // Frame (11.5 + 0.25, 1.5) minus 0.5 is local (1.25, 1.0): a quarter of the way along.
    double v[3];
    int32_t code = -1;
    ASSERT_TRUE(bImagePixelProjectiveWarp(11.75, 1.5, src.get(), nullptr, nullptr, nullptr, nullptr, v, &code));
    EXPECT_EQ(code, 0);
    EXPECT_NEAR(v[0], 0.25, 1e-12);
    EXPECT_NEAR(v[1], 100.0 / 255.0, 1e-12);
    EXPECT_NEAR(v[2], 0.75, 1e-12);
    float vf[3];
    ASSERT_TRUE(bImagePixelProjectiveWarpFloat(11.75f, 1.5f, src.get(), nullptr, nullptr, nullptr, nullptr, vf, &code));
    EXPECT_NEAR(vf[0], 0.25f, 1e-6f);

    // Through a homography and a camera: normalised (0.1, 0) -> pixel (11.75, 1.5).
    Plx_Camera cam;
    ASSERT_TRUE(plx_camera_build_linear(&cam, 1.0, 10.0, 10.0, 10.75, 1.5));
    const Plx_Matrix33 T = translation(0.05, 0.0);
    ASSERT_TRUE(bImagePixelProjectiveWarp(0.05, 0.0, src.get(), nullptr, &cam, &T, nullptr, v, &code));
    EXPECT_NEAR(v[0], 0.25, 1e-9);

    // The last column is never the top-left of a neighbourhood; a cleared mask bit refuses.
    EXPECT_FALSE(bImagePixelProjectiveWarp(13.5, 1.5, src.get(), nullptr, nullptr, nullptr, nullptr, v, &code));
    EXPECT_EQ(code, 0);
    Image mask = make_bits(4, 4, true, 10, 0);
    plx_image_set_bit(mask.get(), 2, 2, 0);
    EXPECT_FALSE(bImagePixelProjectiveWarp(11.75, 1.5, src.get(), mask.get(), nullptr, nullptr, nullptr, v, &code));
    EXPECT_EQ(code, 0);

    // An unsupported type goes to the slot and leaves the trace alone.
    Image bits = make_bits(4, 4, true);
    plx_err_flush_trace();
    EXPECT_FALSE(bImagePixelProjectiveWarp(1.5, 1.5, bits.get(), nullptr, nullptr, nullptr, nullptr, v, &code));
    EXPECT_EQ(code, PLX_ERROR_ILLEGAL_PIXEL_TYPE);
    EXPECT_EQ(plx_err_get_error_count(), 0u);
    EXPECT_TRUE(fails_with(bImagePixelProjectiveWarp(1.5, 1.5, bits.get(), nullptr, nullptr, nullptr, nullptr, v, nullptr),
                           PLX_ERROR_ILLEGAL_PIXEL_TYPE));
}

TEST(ProjectiveWarpFlow, HomographyBecomesDisplacements)
{
    Image mask = make_bits(6, 8, false, 2, 3);
    plx_image_set_bit(mask.get(), 1, 1, 1);
    plx_image_set_bit(mask.get(), 4, 6, 1);
    Plx_Camera a, b;
    ASSERT_TRUE(plx_camera_build_linear(&a, 1.0, 10.0, 10.0, 0.0, 0.0));
    ASSERT_TRUE(plx_camera_build_linear(&b, 1.0, 20.0, 20.0, 0.0, 0.0));
    // Doubling: the pixel centred at frame (3.5, 4.5) moves to (7, 9).
    Plx_Image flow{};
    ASSERT_TRUE(bHomogToFlow(mask.get(), &a, nullptr, &b, &flow));
    ASSERT_EQ(flow.format, PLX_FORMAT_VECTOR2D);
    EXPECT_EQ(pixel(&flow, 1, 1), (std::vector<double>{3.5, 4.5}));
    EXPECT_EQ(pixel(&flow, 4, 6), (std::vector<double>{8.5, 7.5}));
    EXPECT_EQ(pixel(&flow, 0, 0), (std::vector<double>{0.0, 0.0}));
    // A horizon through the pixel's centre sends it to infinity; the flow keeps its values.
    const Plx_Image before = flow;
    Image one = make_bits(1, 1, true, 3, 4);
    const Plx_Matrix33 at_infinity = matrix(1, 0, 0, 0, 1, 0, 1, -1, 1);
    EXPECT_TRUE(fails_with(bHomogToFlow(one.get(), nullptr, &at_infinity, nullptr, &flow), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(flow.data, before.data);
    EXPECT_EQ(pixel(&flow, 1, 1), (std::vector<double>{3.5, 4.5}));
    plx_image_free(&flow);
}

// Every refused call leaves the output and the validity mask as they were.
TEST(ProjectiveWarpFailures, BadInputIsRefusedBeforeTheOutputIsTouched)
{
    Image src = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 8, 8);
    fill_texture(src.get());
    Image out = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 8, 8);
    const double mark[3] = {1, 2, 3};
    plx_image_fill_const(out.get(), mark);
    Image valid = make_bits(8, 8, true);
    const Image out0 = copy(out.get()), valid0 = copy(valid.get());
    const Plx_Matrix33 I = translation(0, 0);
    Image field = make(PLX_FORMAT_VECTOR2D, PLX_TYPE_FLOAT, 8, 8);
    Image ptrs(plx_image_form_gen_p(nullptr, 8, 8));
    Image disp8 = make(PLX_FORMAT_VECTOR2D, PLX_TYPE_UCHAR, 8, 8);
    WarpColourCorrection bad{3, {}}, gain{0, {1.0, 0.0}};
    // Singular mappings: rows 0 and 1 dependent, affine and projective.
    const Plx_Matrix33 flat_affine = matrix(1, 2, 3, 2, 4, 6, 0, 0, 1);
    const Plx_Matrix33 flat_projective = matrix(1, 2, 3, 2, 4, 6, 0.5, 0, 1);
    const struct {
        const Plx_Image *source;
        const Plx_Matrix33 *H;
        const WarpColourCorrection *colour;
        const Plx_Image *displacement;
        uint32_t fast_render;
        int32_t code;
    } cases[] = {
        {field.get(), &I, nullptr, nullptr, 0, PLX_ERROR_ILLEGAL_FORMAT},
        {ptrs.get(), &I, nullptr, nullptr, 0, PLX_ERROR_ILLEGAL_FORMAT},
        {src.get(), &I, &bad, nullptr, 0, PLX_ERROR_ILLEGAL_TYPE},
        {src.get(), &I, nullptr, disp8.get(), 0, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {src.get(), &I, nullptr, field.get(), 1, PLX_ERROR_UNSUPPORTED},
        {src.get(), &I, &gain, nullptr, 1, PLX_ERROR_UNSUPPORTED},
        {src.get(), &flat_affine, nullptr, nullptr, 0, PLX_ERROR_DIVISION_BY_ZERO},
        {src.get(), &flat_projective, nullptr, nullptr, 0, PLX_ERROR_DIVISION_BY_ZERO},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(&c - cases);
        ProjectiveWarpParams p;
        vInitProjectiveWarpParams(&p);
        p.colour_correction = c.colour;
        p.displacement = c.displacement;
        p.fast_render = c.fast_render;
        EXPECT_TRUE(fails_with(warp(c.source, out.get(), c.H, &p, valid.get()), c.code));
        EXPECT_TRUE(same_pixels(out.get(), out0.get()));
        EXPECT_TRUE(same_pixels(valid.get(), valid0.get()));
    }
    Image out_field = make(PLX_FORMAT_VECTOR2D, PLX_TYPE_FLOAT, 8, 8);
    EXPECT_TRUE(fails_with(warp(src.get(), out_field.get(), &I), PLX_ERROR_ILLEGAL_FORMAT));

    // An empty source is no work at all.
    Image empty = make(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 8, 0);
    EXPECT_TRUE(warp(empty.get(), out.get(), &I, nullptr, valid.get()));
    EXPECT_TRUE(same_pixels(out.get(), out0.get()));
    EXPECT_TRUE(same_pixels(valid.get(), valid0.get()));
}

class ProjectiveWarpThreaded : public ::testing::Test {
protected:
    void SetUp() override { vThreadedWorkerPoolFree(); }
    void TearDown() override { vThreadedWorkerPoolFree(); }
};

TEST_F(ProjectiveWarpThreaded, AnyNumberOfJobsGivesTheSameBits)
{
    Image src = make(PLX_FORMAT_RGBA, PLX_TYPE_UCHAR, 61, 83, 3, 1);
    fill_texture(src.get());
    Image smask = make_bits(61, 83, true, 3, 1);
    for (int32_t c = 0; c < 40; ++c) plx_image_set_bit(smask.get(), 30, c, 0);
    Plx_Camera cam;
    ASSERT_TRUE(plx_camera_build_linear(&cam, 1.0, 70.0, 70.0, 40.0, 30.0));
    const Plx_Matrix33 H = matrix(0.97, -0.1, 0.02, 0.12, 1.01, -0.03, 0.05, 0.02, 1.0);
    for (int path = 0; path < 3; ++path) {
        SCOPED_TRACE(path);
        ProjectiveWarpParams p;
        vInitProjectiveWarpParams(&p);
        p.border_fill = 1;
        p.high_quality_fill = path == 1;
        p.fast_render = path == 2;
        p.tile_size = 7;
        if (path == 1) p.window_x = 2, p.window_y = 5, p.window_width = 70, p.window_height = 50;
        Image ref = make(PLX_FORMAT_RGB, PLX_TYPE_USHORT, 64, 80);
        Plx_Image ref_valid{};
        uint32_t ref_stats = 0;
        ASSERT_TRUE(bImageProjectiveWarp(ref.get(), nullptr, &cam, src.get(), smask.get(), &cam, &H, &p, ref.get(),
                                         &ref_valid, nullptr, &ref_stats, 0));
        EXPECT_GT(ref_stats, 1000u);
        for (uint32_t jobs : {1u, 2u, 5u}) {
            PlanoHost *host = plano_host_new(jobs);
            Image out = make(PLX_FORMAT_RGB, PLX_TYPE_USHORT, 64, 80);
            Plx_Image valid{};
            uint32_t stats = 0;
            ASSERT_TRUE(bImageProjectiveWarpThreaded(out.get(), nullptr, &cam, src.get(), smask.get(), &cam, &H, &p,
                                                     out.get(), &valid, plano_host_interface(host), &stats, 0));
            EXPECT_TRUE(same_pixels(out.get(), ref.get())) << jobs;
            EXPECT_TRUE(same_pixels(&valid, &ref_valid)) << jobs;
            EXPECT_EQ(stats, ref_stats) << jobs;
            plx_image_free(&valid);
            plano_host_free(host);
        }
        plx_image_free(&ref_valid);
    }
}

TEST_F(ProjectiveWarpThreaded, JobFunctionCopiesTheBackground)
{
    Image bg = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 10, 10);
    const double v = 0.25;
    plx_image_fill_const(bg.get(), &v);
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 4, 4);
    Image out = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 10, 10);
    ProjectiveWarpJob job{};
    job.background = bg.get();
    job.source = src.get();
    job.output = out.get();
    vInitProjectiveWarpParams(&job.params);
    ASSERT_TRUE(pfncImageProjectiveWarp(&job));
    EXPECT_EQ(pixel(out.get(), 9, 9)[0], 0.25);
    EXPECT_EQ(pixel(out.get(), 1, 1)[0], 0.0);
}

struct InterruptAfter {
    std::atomic<int> calls{0};
    int answer_at;
    std::atomic<int> last_progress{-1};
    static int32_t interrupt(void *self)
    {
        auto *me = static_cast<InterruptAfter *>(self);
        return ++me->calls >= me->answer_at ? 1 : 0;
    }
    static void progress(void *self, int32_t percent) { static_cast<InterruptAfter *>(self)->last_progress = percent; }
};

TEST(ProjectiveWarpHost, InterruptLeavesLaterRowsUnwrittenAndSucceeds)
{
    // Wider than one column strip, so rows are cut across strips.
    Image src = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 200, 300);
    fill_texture(src.get());
    const Plx_Matrix33 I = translation(0, 0);
    InterruptAfter state;
    state.answer_at = 3;
    ThreadHostInterface host{};
    host.callback_context = &state;
    host.interrupt = InterruptAfter::interrupt;
    host.progress = InterruptAfter::progress;
    for (int fast = 0; fast < 2; ++fast) {
        state.calls = 0;
        ProjectiveWarpParams p;
        vInitProjectiveWarpParams(&p);
        p.fast_render = fast;
        p.tile_size = 4;
        Image out = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 200, 300);
        const double mark = -1.0;
        plx_image_fill_const(out.get(), &mark);
        ASSERT_TRUE(warp(src.get(), out.get(), &I, &p, nullptr, nullptr, nullptr, nullptr, nullptr, &host));
        // The interrupt is asked after each row (after each row of 4-row tiles when fast):
        // the third answer stops the warp after 3 (12) whole rows.
        const int32_t written = fast ? 12 : 3;
        for (int32_t r = 0; r < 200; ++r)
            for (int32_t c : {5, 150, 298})  // the last column has no bilinear neighbourhood
                EXPECT_EQ(pixel(out.get(), r, c)[0] != -1.0, r < written) << fast << " row " << r << " col " << c;
    }
    // Progress: the first row reports 0; a full run passes 50%.
    state.calls = 0;
    state.answer_at = 1 << 30;
    Image out = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 200, 300);
    ASSERT_TRUE(warp(src.get(), out.get(), &I, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, &host));
    EXPECT_EQ(state.last_progress, 75);  // rows 0, 50, 100, 150 of 200
}

}  // namespace
