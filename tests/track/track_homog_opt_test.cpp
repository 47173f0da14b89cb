// The joint homography optimiser: the pixel-match, homography, constraint and angle functions
// against central differences and known values; state initialisation and the motion prior;
// block building; and whole levels on synthetic frames related by known homographies.
#include <gtest/gtest.h>

#include <algorithm>
#include <cfloat>
#include <cmath>
#include <cstring>
#include <random>
#include <functional>
#include <memory>
#include <numbers>
#include <string>
#include <vector>

#include "plano/sumo_states.h"
#include "plano/track.h"
#include "plano/track_homography.h"
#include "plano_host/host.h"
#include "failure_check.hpp"
#include "track/pixel_match_lanes.hpp"

namespace {

using plano_test::fails_with;

template <auto Free>
struct Deleter {
    template <class T>
    void operator()(T *p) const { Free(p); }
};
void free_sumo(Sumo *s) { vSumoFree(s, nullptr); }
using SumoPtr = std::unique_ptr<Sumo, Deleter<free_sumo>>;
using ImagePtr = std::unique_ptr<Plx_Image, Deleter<plx_image_free>>;
using HostPtr = std::unique_ptr<PlanoHost, Deleter<plano_host_free>>;

// A bit mask with every bit set except those listed as (row, column).
Plx_Image *mask_without(int32_t h, int32_t w, std::initializer_list<std::pair<int32_t, int32_t>> cleared)
{
    Plx_Image *mask = plx_image_form_gen_b(nullptr, h, w);
    const double one = 1.0;
    plx_image_fill_const(mask, &one);
    for (auto [r, c] : cleared) plx_image_set_bit(mask, r, c, 0);
    return mask;
}

SumoStateVector *make_state(Sumo *sumo, std::vector<double> x, int32_t type)
{
    SumoStateVector *s = pSumoStateVectorNew(sumo, sumo->root, uint32_t(x.size()), nullptr, nullptr);
    Plx_Vector v;
    plx_vec_form_data(&v, uint32_t(x.size()), x.data());
    EXPECT_TRUE(bSumoStateVectorInit(sumo, s, &v));
    s->x.type = type;
    return s;
}

// A smooth, non-periodic texture in [0.1, 0.9].
double texture(double x, double y)
{
    return 0.5 + 0.15 * std::sin(0.31 * x + 0.2 * y) + 0.12 * std::cos(0.23 * y - 0.11 * x + 1.0) +
           0.1 * std::sin(0.47 * x) * std::cos(0.39 * y) + 0.08 * std::sin(0.13 * x + 0.61 * y);
}

// Float image sampling the texture at pixel centres (channel k shifted by 7k pixels).
ImagePtr float_image(int32_t h, int32_t w, Plx_ImageFormat format)
{
    ImagePtr image(plx_image_form_gen(nullptr, format, PLX_TYPE_FLOAT, h, w));
    const uint32_t ch = plx_image_format_channels(format);
    for (int32_t r = 0; r < h; ++r)
        for (int32_t c = 0; c < w; ++c)
            for (uint32_t k = 0; k < ch; ++k)
                static_cast<float *>(plx_image_row(image.get(), r))[c * ch + k] =
                    float(texture(c + 0.5 + 7.0 * k, r + 0.5 - 3.0 * k));
    return image;
}

// One pixel-match set-up: a Sumo with a homography state (and illumination), a block over a
// float search image.
struct PixelCase {
    SumoPtr sumo{pSumoForm(nullptr, nullptr)};
    ImagePtr search;
    Plx_Image *mask = nullptr;
    std::vector<float> positions;
    TrackPixelBlock block{};
    SumoStateVector *states[2] = {nullptr, nullptr};
    Plx_Vector z{};
    uint32_t channels = 1;

    PixelCase(Plx_ImageFormat format, std::vector<double> params, int32_t type, double zh)
    {
        search = float_image(16, 16, format);
        channels = format == PLX_FORMAT_GREY ? 1 : 3;
        for (int y = 2; y <= 6; y += 2)
            for (int x = 2; x <= 7; ++x) positions.insert(positions.end(), {x + 0.5f, y + 0.5f});
        block = {zh, float(zh), search.get(), nullptr, positions.data(), uint32_t(positions.size() / 2), nullptr, nullptr};
        states[0] = make_state(sumo.get(), std::move(params), type);
        states[1] = make_state(sumo.get(), {1.2, 0.1}, 0);
        plx_vec_form(&z, block.no_pixels * channels);
        for (uint32_t i = 0; i < z.rows; ++i) z.data[i] = 0.4 + 0.01 * i;
    }
    ~PixelCase()
    {
        plx_vec_free(&z);
        plx_image_free(mask);
        plx_image_free(&gradient_x);
        plx_image_free(&gradient_y);
    }
    // Gives the block the search image's central-difference gradients (after any mask).
    void use_gradients()
    {
        ASSERT_TRUE(bTrackSearchGradients(search.get(), mask, &gradient_x, &gradient_y));
        block.search_gradient_x = &gradient_x;
        block.search_gradient_y = &gradient_y;
    }
    // Sends pixel 0 past the right edge and clears the search pixel under pixel 2: (4.5, 2.5)
    // reads cell (4, 2), pixel 3 cell (5, 2).
    void drop_pixels()
    {
        positions[0] = 15.6f;
        mask = mask_without(16, 16, {{3, 4}});
        block.search_mask = mask;
    }
    Plx_Image gradient_x{}, gradient_y{};
    SumoVector zvec()
    {
        SumoVector v{};
        v.v = z;
        v.user_data = &block;
        return v;
    }
};

// An h function's outputs: m predictions, the Jacobians of an n-parameter homography state and
// of the illumination state.
struct HOutputs {
    Plx_Vector h{};
    Plx_Matrix J0{}, J1{};
    Plx_Matrix *J[2] = {&J0, &J1};
    HOutputs(uint32_t m, uint32_t n) { plx_vec_form(&h, m), plx_mat_form(&J0, m, n), plx_mat_form(&J1, m, 2); }
    ~HOutputs() { plx_vec_free(&h), plx_mat_free(&J0), plx_mat_free(&J1); }
};

// Central differences of an h function against its analytic Jacobians, for every state.
void expect_jacobians(SumoHFunction f, SumoStateVector **states, uint32_t n_states, const SumoVector &z,
                      double step, double tolerance)
{
    const uint32_t m = z.v.rows;
    std::vector<Plx_Matrix> J(n_states);
    std::vector<Plx_Matrix *> Jp(n_states);
    for (uint32_t s = 0; s < n_states; ++s) {
        plx_mat_form(&J[s], m, states[s]->x.v.rows);
        Jp[s] = &J[s];
    }
    Plx_Vector h0{}, hp{}, hm{};
    plx_vec_form(&h0, m), plx_vec_form(&hp, m), plx_vec_form(&hm, m);
    ASSERT_TRUE(f(nullptr, nullptr, states, n_states, &z, &h0, Jp.data()));
    for (uint32_t s = 0; s < n_states; ++s) {
        double *x = states[s]->x.v.data;
        for (uint32_t k = 0; k < states[s]->x.v.rows; ++k) {
            const double saved = x[k];
            x[k] = saved + step;
            ASSERT_TRUE(f(nullptr, nullptr, states, n_states, &z, &hp, nullptr));
            x[k] = saved - step;
            ASSERT_TRUE(f(nullptr, nullptr, states, n_states, &z, &hm, nullptr));
            x[k] = saved;
            for (uint32_t r = 0; r < m; ++r) {
                const double numeric = (hp.data[r] - hm.data[r]) / (2 * step);
                const double analytic = J[s].data[r * J[s].cols + k];
                EXPECT_NEAR(analytic, numeric, tolerance * (1.0 + std::fabs(numeric)))
                    << "state " << s << " parameter " << k << " row " << r;
            }
        }
    }
    for (auto &j : J) plx_mat_free(&j);
    plx_vec_free(&h0), plx_vec_free(&hp), plx_vec_free(&hm);
}

struct PixelFunction {
    const char *name;
    SumoHFunction f;
    Plx_ImageFormat format;
    std::vector<double> params;  // at zh 2: the warp moves every pixel by about (0.3, 0.35)
    int32_t type;
};

std::vector<PixelFunction> pixel_functions()
{
    const std::vector<double> affine = {1.0, 0.01, 0.15, -0.008, 1.0, 0.175};
    const std::vector<double> proj = {1.0, 0.01, 0.15, -0.008, 1.0, 0.175, 0.0004, -0.0003, 1.0};
    return {
        {"affine", bPixelMatchAffineH, PLX_FORMAT_GREY, affine, TRACK_STATE_AFFINE},
        {"proj", bPixelMatchProjH, PLX_FORMAT_GREY, proj, TRACK_STATE_PROJ},
        {"translate", bPixelMatchTranslateH, PLX_FORMAT_GREY, {0.15, 0.175}, TRACK_STATE_TRANSLATE},
        {"trs", bPixelMatchTransRotScaleH, PLX_FORMAT_GREY, {1.0, 0.15, 0.004, 0.175}, TRACK_STATE_TRANS_ROT_SCALE},
        {"ts", bPixelMatchTransScaleH, PLX_FORMAT_GREY, {1.003, 0.15, 0.175}, TRACK_STATE_TRANS_SCALE},
        {"affine rgb", bPixelMatchAffineRGBH, PLX_FORMAT_RGB, affine, TRACK_STATE_AFFINE},
        {"proj rgba", bPixelMatchProjRGBH, PLX_FORMAT_RGBA, proj, TRACK_STATE_PROJ},
        {"translate rgb", bPixelMatchTranslateRGBH, PLX_FORMAT_RGB, {0.15, 0.175}, TRACK_STATE_TRANSLATE},
    };
}

TEST(TrackHomogPixelMatch, JacobiansMatchCentralDifferences)
{
    for (const PixelFunction &pf : pixel_functions()) {
        SCOPED_TRACE(pf.name);
        PixelCase pc(pf.format, pf.params, pf.type, 2.0);
        SumoVector z = pc.zvec();
        expect_jacobians(pf.f, pc.states, 2, z, 2e-4, 5e-3);
        // Without the illumination state the prediction is the plain interpolation.
        expect_jacobians(pf.f, pc.states, 1, z, 2e-4, 5e-3);
    }
}

// Translation (0.15, 0.175) at zh 2 with gain 1.2 and offset 0.1 moves pixel 0 at (2.5, 2.5) to
// (2.8, 2.85): cell (2, 2), fractions (0.3, 0.35). The prediction is 1.2 times the bilinear value
// plus 0.1; with gradient images the derivatives are the interpolated central differences,
// J = 1.2 * 2 * (gx, gy), per channel.
TEST(TrackHomogPixelMatch, BilinearPredictionAndGradientImageDerivatives)
{
    for (Plx_ImageFormat format : {PLX_FORMAT_GREY, PLX_FORMAT_RGB}) {
        PixelCase pc(format, {0.15, 0.175}, TRACK_STATE_TRANSLATE, 2.0);
        SumoVector z = pc.zvec();
        const uint32_t C = pc.channels;
        HOutputs plain(z.v.rows, 2), out(z.v.rows, 2);
        const Plx_Vector &h = out.h;
        const Plx_Matrix &J0 = out.J0;
        const SumoHFunction f = C == 1 ? bPixelMatchTranslateH : bPixelMatchTranslateRGBH;
        ASSERT_TRUE(f(nullptr, nullptr, pc.states, 2, &z, &plain.h, nullptr));  // without gradient images
        pc.use_gradients();
        ASSERT_TRUE(f(nullptr, nullptr, pc.states, 2, &z, &out.h, out.J));
        auto at = [&](int r, int c, uint32_t k) {
            return double(static_cast<float *>(plx_image_row(pc.search.get(), r))[c * C + k]);
        };
        const double fx = 0.3, fy = 0.35;
        for (uint32_t k = 0; k < C; ++k) {
            auto value = [&](int r, int c) { return at(r, c, k); };
            auto gx = [&](int r, int c) { return (at(r, c + 1, k) - at(r, c - 1, k)) / 2; };
            auto gy = [&](int r, int c) { return (at(r + 1, c, k) - at(r - 1, c, k)) / 2; };
            auto lerp = [&](auto g) {
                return (1 - fy) * ((1 - fx) * g(2, 2) + fx * g(2, 3)) + fy * ((1 - fx) * g(3, 2) + fx * g(3, 3));
            };
            EXPECT_NEAR(plain.h.data[k], 1.2 * lerp(value) + 0.1, 1e-5) << "channel " << k;
            EXPECT_EQ(h.data[k], plain.h.data[k]) << "channel " << k;
            EXPECT_NEAR(J0.data[k * 2 + 0], 1.2 * 2.0 * lerp(gx), 1e-5) << "channel " << k;
            EXPECT_NEAR(J0.data[k * 2 + 1], 1.2 * 2.0 * lerp(gy), 1e-5) << "channel " << k;
        }
        // On a smooth texture they are close to the interpolant's own derivatives.
        expect_jacobians(f, pc.states, 2, z, 2e-4, 5e-2);
    }
}

// Central differences inside, one-sided at the image edges and next to cleared mask bits,
// zero with no usable neighbour; gradient images that do not fit the search image fail.
TEST(TrackHomogPixelMatch, SearchGradientsAtEdgesAndMasks)
{
    ImagePtr im(plx_image_form_gen_gl_f(nullptr, 3, 4));
    const float v[3][4] = {{1, 2, 4, 8}, {0, 3, 9, 27}, {5, 5, 6, 1}};
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 4; ++c) static_cast<float *>(plx_image_row(im.get(), r))[c] = v[r][c];
    ImagePtr mask(mask_without(3, 4, {{1, 2}}));
    Plx_Image gx{}, gy{};
    ASSERT_TRUE(bTrackSearchGradients(im.get(), mask.get(), &gx, &gy));
    auto GX = [&](int r, int c) { return static_cast<float *>(plx_image_row(&gx, r))[c]; };
    auto GY = [&](int r, int c) { return static_cast<float *>(plx_image_row(&gy, r))[c]; };
    EXPECT_EQ(GX(0, 0), 1.f);    // right only
    EXPECT_EQ(GX(0, 1), 1.5f);   // (4 - 1) / 2
    EXPECT_EQ(GX(0, 3), 4.f);    // left only
    EXPECT_EQ(GX(1, 1), 3.f);    // right neighbour cleared: 3 - 0
    EXPECT_EQ(GX(1, 3), 0.f);    // left neighbour cleared, no right one
    EXPECT_EQ(GX(1, 2), 0.f);    // cleared pixel
    EXPECT_EQ(GY(0, 0), -1.f);   // below only
    EXPECT_EQ(GY(1, 0), 2.f);    // (5 - 1) / 2
    EXPECT_EQ(GY(2, 2), 0.f);    // pixel above cleared, no row below
    EXPECT_EQ(GY(0, 2), 0.f);    // pixel below cleared, no row above
    EXPECT_EQ(GY(2, 3), -26.f);  // above only: 1 - 27
    // Without a mask every neighbour counts.
    ASSERT_TRUE(bTrackSearchGradients(im.get(), nullptr, &gx, &gy));
    EXPECT_EQ(GX(1, 3), 18.f);
    EXPECT_EQ(GY(1, 2), 1.f);
    // Unfit arguments.
    EXPECT_TRUE(fails_with(bTrackSearchGradients(im.get(), nullptr, &gx, &gx), PLX_ERROR_INCOMPATIBLE));
    ImagePtr small(plx_image_form_gen_b(nullptr, 2, 4));
    EXPECT_TRUE(fails_with(bTrackSearchGradients(im.get(), small.get(), &gx, &gy), PLX_ERROR_INCOMPATIBLE));
    ImagePtr bytes(plx_image_form_gen_gl_uc(nullptr, 3, 4));
    EXPECT_TRUE(fails_with(bTrackSearchGradients(bytes.get(), nullptr, &gx, &gy), PLX_ERROR_ILLEGAL_ARGUMENT));
    plx_image_free(&gx);
    plx_image_free(&gy);
}

TEST(TrackHomogPixelMatch, PixelsLeavingTheWindowOrMaskContributeNothing)
{
    for (const PixelFunction &pf : pixel_functions()) {
        SCOPED_TRACE(pf.name);
        PixelCase pc(pf.format, pf.params, pf.type, 2.0);
        // Pixel 1 lands left of the image too.
        pc.drop_pixels();
        pc.positions[2] = -0.4f;
        SumoVector z = pc.zvec();
        const uint32_t m = z.v.rows, C = pc.channels;
        HOutputs out(m, pc.states[0]->x.v.rows);
        const Plx_Vector &h = out.h;
        const Plx_Matrix &J0 = out.J0, &J1 = out.J1;
        std::fill_n(J0.data, m * J0.cols, 99.0);
        std::fill_n(J1.data, m * 2, 99.0);
        ASSERT_TRUE(pf.f(nullptr, nullptr, pc.states, 2, &z, &out.h, out.J));
        for (uint32_t p = 0; p < 4; ++p)
            for (uint32_t ch = 0; ch < C; ++ch) {
                const uint32_t r = p * C + ch;
                const bool dropped = p < 3;
                if (dropped) {
                    EXPECT_EQ(h.data[r], z.v.data[r]) << "pixel " << p;
                    for (uint32_t k = 0; k < J0.cols; ++k) EXPECT_EQ(J0.data[r * J0.cols + k], 0.0);
                    EXPECT_EQ(J1.data[2 * r], 0.0);
                    EXPECT_EQ(J1.data[2 * r + 1], 0.0);
                } else {
                    EXPECT_NE(h.data[r], z.v.data[r]);
                    EXPECT_EQ(J1.data[2 * r + 1], 1.0);
                }
            }
    }
}

// The optimiser takes pixel blocks through a fused kernel that never writes the Jacobians
// out: its information blocks, vectors and cost must be those of the h function's own
// prediction and Jacobians (up to the single-precision sums), with dropped pixels, with and
// without the illumination state, for a scaled identity and a diagonal information. A further
// state, which the prediction ignores, gets no information.
TEST(TrackHomogPixelMatch, OptimiserBuildsBlocksAsTheirJacobiansSay)
{
    for (const PixelFunction &pf : pixel_functions())
        for (uint32_t obs_states : {1u, 2u, 3u})
            for (int variant = 0; variant < 3; ++variant) {
                const bool diagonal = variant == 1, gradients = variant == 2;
                const uint32_t n_states = std::min(obs_states, 2u);
                SCOPED_TRACE(std::string(pf.name) + " states " + std::to_string(obs_states) +
                             (diagonal ? " diagonal" : "") + (gradients ? " gradients" : ""));
                PixelCase pc(pf.format, pf.params, pf.type, 2.0);
                SumoStateVector *extra = make_state(pc.sumo.get(), {0.5, -0.5}, 0);
                SumoStateVector *with_extra[3] = {pc.states[0], pc.states[1], extra};
                pc.drop_pixels();
                if (gradients) pc.use_gradients();
                SumoVector z = pc.zvec();
                const uint32_t m = z.v.rows, n = pc.states[0]->x.v.rows;
                std::vector<double> info(m, 1.0 / (0.02 * 0.02));
                if (diagonal)
                    for (uint32_t r = 0; r < m; ++r) info[r] *= 0.5 + 0.1 * (r % 7);
                Plx_SquMatrix N;
                plx_squmat_form_data(&N, diagonal ? PLX_SQUMAT_DIAGONAL : PLX_SQUMAT_SCALED_IDENTITY, m, info.data());
                SumoObs *o = pSumoObsH(pc.sumo.get(), &z.v, &N, pf.f, nullptr, with_extra, obs_states);
                ASSERT_NE(o, nullptr);
                o->z.user_data = &pc.block;
                ASSERT_TRUE(bSumoBuildInformationBlocksBranch(pc.sumo.get(), pc.sumo->root, 1, 0xFFFFFFFFu,
                                                              0xFFFFFFFFu, nullptr));
                if (obs_states == 3) {
                    for (uint32_t i = 0; i < 4; ++i) EXPECT_EQ(extra->A_work.data[i], 0.0);
                }

                // The reference from the h function, in double.
                HOutputs out(m, n);
                const Plx_Vector &h = out.h;
                const Plx_Matrix &Jh = out.J0, &Ji = out.J1;
                ASSERT_TRUE(pf.f(nullptr, nullptr, pc.states, n_states, &z, &out.h, out.J));
                const uint32_t P = n + (n_states == 2 ? 2 : 0);
                std::vector<double> H(P * P, 0.0), g(P, 0.0);
                double chi2 = 0.0;
                for (uint32_t r = 0; r < m; ++r) {
                    std::vector<double> j(Jh.data + r * n, Jh.data + (r + 1) * n);
                    if (n_states == 2) j.insert(j.end(), Ji.data + 2 * r, Ji.data + 2 * r + 2);
                    const double w = info[diagonal ? r : 0], res = z.v.data[r] - h.data[r];
                    chi2 += w * res * res;
                    for (uint32_t a = 0; a < P; ++a) {
                        g[a] += w * j[a] * res;
                        for (uint32_t b = 0; b < P; ++b) H[a * P + b] += w * j[a] * j[b];
                    }
                }
                double scale = 0.0, gscale = 0.0;
                for (double v : H) scale = std::max(scale, std::fabs(v));
                for (double v : g) gscale = std::max(gscale, std::fabs(v));
                auto expect_block = [&](const double *got, uint32_t r0, uint32_t c0, uint32_t rows, uint32_t cols) {
                    for (uint32_t a = 0; a < rows; ++a)
                        for (uint32_t b = 0; b < cols; ++b)
                            EXPECT_NEAR(got[a * cols + b], H[(r0 + a) * P + c0 + b], 1e-5 * scale) << a << "," << b;
                };
                expect_block(pc.states[0]->A_work.data, 0, 0, n, n);
                for (uint32_t a = 0; a < n; ++a) EXPECT_NEAR(pc.states[0]->b_work.data[a], g[a], 1e-5 * gscale);
                if (n_states == 2) {
                    expect_block(pc.states[1]->A_work.data, n, n, 2, 2);
                    for (uint32_t a = 0; a < 2; ++a) EXPECT_NEAR(pc.states[1]->b_work.data[a], g[n + a], 1e-5 * gscale);
                    const SumoOffdiag *k = pc.states[0]->row_blocks ? pc.states[0]->row_blocks : pc.states[1]->row_blocks;
                    ASSERT_NE(k, nullptr);
                    if (k->row == pc.states[0])
                        expect_block(k->M_work.data, 0, n, n, 2);
                    else
                        expect_block(k->M_work.data, n, 0, 2, n);
                }
                SumoWorkspace *ws = pSumoWorkspaceForm(nullptr);
                EXPECT_NEAR(dSumoObsComputeResidual(pc.sumo.get(), ws, o), chi2, 1e-5 * chi2);
                vSumoWorkspaceFree(ws);
            }
}

// The fused kernel's portable and AVX2 lane packs must give the same bits, so that results
// do not depend on the machine: blocks with partial groups, pixels outside the image and
// under mask holes, every warp, grey and colour, with and without gain, both weightings.
template <plano::pixel_match::Warp W, uint32_t C, bool Illum>
void expect_same_lanes(const plano::pixel_match::BlockArgs &args)
{
    namespace pm = plano::pixel_match;
    constexpr uint32_t P = pm::warp_params<W>() + (Illum ? 2 : 0);
    double chi[2], jtnj[2][P * P], jtnr[2][P];
    pm::portable::fused_block<W, C, Illum>(args, 0.25, &chi[0], jtnj[0], jtnr[0]);
    pm::avx2::fused_block<W, C, Illum>(args, 0.25, &chi[1], jtnj[1], jtnr[1]);
    EXPECT_EQ(std::memcmp(&chi[0], &chi[1], sizeof chi[0]), 0) << chi[0] << " " << chi[1];
    if (!args.terms) return;
    EXPECT_EQ(std::memcmp(jtnj[0], jtnj[1], sizeof jtnj[0]), 0);
    EXPECT_EQ(std::memcmp(jtnr[0], jtnr[1], sizeof jtnr[0]), 0);
    EXPECT_NE(jtnj[0][0], 0.0);
}

template <plano::pixel_match::Warp W, uint32_t C>
void expect_same_lanes_with_and_without_gain(plano::pixel_match::BlockArgs args, std::initializer_list<float> p)
{
    std::copy(p.begin(), p.end(), args.p);
    expect_same_lanes<W, C, true>(args);
    expect_same_lanes<W, C, false>(args);
}

TEST(TrackHomogPixelMatch, PortableAndVectorKernelsGiveTheSameBits)
{
    namespace pm = plano::pixel_match;
    if (!pm::avx2_available()) GTEST_SKIP() << "no AVX2 on this machine";
    using W = pm::Warp;
    std::mt19937 rng(5);
    std::uniform_real_distribution<float> u(0.f, 1.f);
    for (Plx_ImageFormat format : {PLX_FORMAT_GREY, PLX_FORMAT_RGBA})
        for (uint32_t n_px : {5u, 61u})
            for (int variant = 0; variant < 8; ++variant) {
                SCOPED_TRACE(std::to_string(format) + " " + std::to_string(n_px) + " " + std::to_string(variant));
                ImagePtr search = float_image(40, 48, format);
                ImagePtr mask(mask_without(40, 48, {}));
                for (int k = 0; k < 12; ++k) plx_image_set_bit(mask.get(), 10 + k, 5 + 3 * k, 0);
                std::vector<float> pos;
                for (uint32_t i = 0; i < n_px; ++i) pos.insert(pos.end(), {u(rng) * 52.f - 2.f, u(rng) * 44.f - 2.f});
                std::vector<double> z(n_px * 4), info(n_px * 4);
                for (std::size_t i = 0; i < z.size(); ++i) z[i] = u(rng), info[i] = 100.0 + 50.0 * u(rng);
                pm::BlockArgs a{};
                a.gain = 1.1f, a.offset = 0.05f, a.zh = 1.5f;
                a.data = static_cast<const float *>(search->data);
                a.stride = search->stride / 4;
                a.step = int32_t(plx_image_format_channels(format));
                a.wlim = 47.f, a.hlim = 39.f;
                a.mask = variant & 1 ? mask.get() : nullptr;
                a.positions = pos.data();
                a.no_pixels = n_px;
                a.z = z.data();
                a.info = info.data();
                a.info_step = variant & 2 ? 1 : 0;
                Plx_Image gx{}, gy{};
                if (variant & 4) {
                    ASSERT_TRUE(bTrackSearchGradients(search.get(), a.mask, &gx, &gy));
                    a.grad_x = static_cast<const float *>(gx.data);
                    a.grad_y = static_cast<const float *>(gy.data);
                }
                for (bool terms : {true, false}) {
                    a.terms = terms;
                    if (format == PLX_FORMAT_GREY) {
                        expect_same_lanes_with_and_without_gain<W::proj, 1>(
                            a, {1.01f, 0.02f, 0.7f, -0.03f, 0.98f, 0.4f, 0.001f, -0.002f, 1.f});
                        expect_same_lanes_with_and_without_gain<W::affine, 1>(a, {1.01f, 0.02f, 0.7f, -0.03f, 0.98f, 0.4f});
                        expect_same_lanes_with_and_without_gain<W::translate, 1>(a, {0.7f, 0.4f});
                        expect_same_lanes_with_and_without_gain<W::trans_rot_scale, 1>(a, {1.01f, 0.7f, 0.03f, 0.4f});
                        expect_same_lanes_with_and_without_gain<W::trans_scale, 1>(a, {0.99f, 0.7f, 0.4f});
                    } else {
                        expect_same_lanes_with_and_without_gain<W::proj, 3>(
                            a, {1.01f, 0.02f, 0.7f, -0.03f, 0.98f, 0.4f, 0.001f, -0.002f, 1.f});
                        expect_same_lanes_with_and_without_gain<W::affine, 3>(a, {1.01f, 0.02f, 0.7f, -0.03f, 0.98f, 0.4f});
                        expect_same_lanes_with_and_without_gain<W::translate, 3>(a, {0.7f, 0.4f});
                    }
                }
                plx_image_free(&gx);
                plx_image_free(&gy);
            }
}

TEST(TrackHomogPixelMatch, RejectsBlocksThatDoNotFit)
{
    PixelCase pc(PLX_FORMAT_RGB, {0.15, 0.175}, TRACK_STATE_TRANSLATE, 2.0);
    SumoVector z = pc.zvec();
    HOutputs out(z.v.rows, 2);
    auto call = [&](SumoHFunction f, const SumoVector *zp) {
        return f(nullptr, nullptr, pc.states, 2, zp, &out.h, nullptr);
    };
    // A grey function over an RGB image, and a z that is not three values per pixel.
    EXPECT_FALSE(call(bPixelMatchTranslateH, &z));
    z.v.rows -= 1;
    EXPECT_TRUE(fails_with(call(bPixelMatchTranslateRGBH, &z), PLX_ERROR_INCOMPATIBLE));
    EXPECT_TRUE(fails_with(call(bPixelMatchTranslateRGBH, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    // Gradient images: both or neither, each like the search image.
    z.v.rows += 1;
    pc.use_gradients();
    ASSERT_TRUE(call(bPixelMatchTranslateRGBH, &z));
    pc.block.search_gradient_y = nullptr;
    EXPECT_TRUE(fails_with(call(bPixelMatchTranslateRGBH, &z), PLX_ERROR_INCOMPATIBLE));
    ImagePtr grey = float_image(16, 16, PLX_FORMAT_GREY);
    pc.block.search_gradient_y = grey.get();
    EXPECT_TRUE(fails_with(call(bPixelMatchTranslateRGBH, &z), PLX_ERROR_INCOMPATIBLE));
}

// ---- states and homography observations ----

Plx_Matrix33 mat33(std::initializer_list<double> v)
{
    Plx_Matrix33 H{};
    int i = 0;
    for (double x : v) H.m[i / 3][i % 3] = x, ++i;
    return H;
}

// Each model's state starts at the homography scaled as the model keeps it (m22 = 1, or unit
// norm for the projective state) and reads back as such. A homography observation made from
// that homography has zero residual, and its h function is the identity on the parameters
// (their offset from the start for the projective state).
TEST(TrackHomogStates, MotionInitReadsBackAndHomographyObservationHoldsIt)
{
    const Plx_Matrix33 proj = mat33({1.1, 0.1, 5, -0.1, 0.9, 3, 0.001, 0.002, 1});
    struct Case {
        uint32_t model;
        Plx_Matrix33 H;
        Plx_Matrix33 expected;
        bool read_back;
    };
    const Case cases[] = {
        {TRACK_MODEL_AFFINE, mat33({2.2, 0.2, 6, -0.4, 1.8, 8, 0, 0, 2}), mat33({1.1, 0.1, 3, -0.2, 0.9, 4, 0, 0, 1}), true},
        {TRACK_MODEL_TRANSLATE, mat33({1, 0, 3, 0, 1, -4, 0, 0, 1}), mat33({1, 0, 3, 0, 1, -4, 0, 0, 1}), true},
        {TRACK_MODEL_TRANS_ROT_SCALE, mat33({2, -0.4, 6, 0.4, 2, 8, 0, 0, 2}), mat33({1, -0.2, 3, 0.2, 1, 4, 0, 0, 1}), true},
        {TRACK_MODEL_TRANS_SCALE, mat33({3, 0, 6, 0, 3, 9, 0, 0, 3}), mat33({1, 0, 2, 0, 1, 3, 0, 0, 1}), true},
        {TRACK_MODEL_PROJ, mat33({3, 0, 0, 0, 4, 0, 0, 0, 0}), mat33({0.6, 0, 0, 0, 0.8, 0, 0, 0, 0}), true},
        {TRACK_MODEL_PROJ, proj, proj, false},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.model);
        SumoPtr sumo(pSumoForm(nullptr, nullptr));
        SumoStateVector *s = pSumoStateVectorNew(sumo.get(), sumo->root, 9, nullptr, nullptr);
        ASSERT_TRUE(bMotionInit(sumo.get(), s, c.model, &c.H));
        Plx_Matrix33 back;
        ASSERT_TRUE(bPixelMatchMatRead(s, &back));
        for (int i = 0; i < 9 && c.read_back; ++i)
            EXPECT_NEAR(back.m[i / 3][i % 3], c.expected.m[i / 3][i % 3], 1e-12) << i;
        const uint32_t n = s->x.v.rows;
        Plx_SquMatrix *info = plx_squmat_new(PLX_SQUMAT_SCALED_IDENTITY, n);
        info->data[0] = 4.0;
        SumoObs *obs = nullptr;
        ASSERT_TRUE(bHomogObs(sumo.get(), s, c.model, &c.H, info, nullptr, &obs));
        SumoWorkspace *ws = pSumoWorkspaceForm(nullptr);
        EXPECT_NEAR(dSumoObsComputeResidual(sumo.get(), ws, obs), 0.0, 1e-20);
        expect_jacobians(obs->func.h, &s, 1, obs->z, 1e-3, 1e-9);
        // Moving parameter 0 by 0.5 costs 4 * 0.25.
        s->x.v.data[0] += 0.5;
        EXPECT_NEAR(dSumoObsComputeResidual(sumo.get(), ws, obs), 1.0, 1e-12);
        vSumoWorkspaceFree(ws);
        plx_squmat_free(info);
    }
}

TEST(TrackHomogStates, MotionInitRefusesWrongShapes)
{
    struct Case {
        uint32_t model;
        Plx_Matrix33 H;
        int32_t code;
    };
    const Case cases[] = {
        {TRACK_MODEL_AFFINE, mat33({1, 0, 0, 0, 1, 0, 0.001, 0, 1}), PLX_ERROR_INCOMPATIBLE},
        {TRACK_MODEL_AFFINE, mat33({1, 0, 0, 0, 1, 0, 0, 0, 0}), PLX_ERROR_INCOMPATIBLE},
        {TRACK_MODEL_TRANSLATE, mat33({1.01, 0, 0, 0, 1.01, 0, 0, 0, 1}), PLX_ERROR_INCOMPATIBLE},
        {TRACK_MODEL_TRANS_ROT_SCALE, mat33({1, 0.1, 0, 0.1, 1, 0, 0, 0, 1}), PLX_ERROR_INCOMPATIBLE},
        {TRACK_MODEL_TRANS_SCALE, mat33({1, 0.1, 0, -0.1, 1, 0, 0, 0, 1}), PLX_ERROR_INCOMPATIBLE},
        {7u, mat33({1, 0, 0, 0, 1, 0, 0, 0, 1}), PLX_ERROR_ILLEGAL_TYPE},
    };
    for (const Case &c : cases) {
        SumoPtr sumo(pSumoForm(nullptr, nullptr));
        SumoStateVector *s = pSumoStateVectorNew(sumo.get(), sumo->root, 9, nullptr, nullptr);
        EXPECT_TRUE(fails_with(bMotionInit(sumo.get(), s, c.model, &c.H), c.code)) << c.model;
    }
    SumoPtr sumo(pSumoForm(nullptr, nullptr));
    SumoStateVector *s = make_state(sumo.get(), {1, 2}, 12345);
    Plx_Matrix33 H;
    EXPECT_TRUE(fails_with(bPixelMatchMatRead(s, &H), PLX_ERROR_CALLEE));
}

// The motion prior's information against its formula, written out plainly.
TEST(TrackHomogStates, MotionPriorMatchesItsFormula)
{
    const double w = 0.2, zh = 1.5;
    const uint32_t height = 40, width = 60;
    const double a = std::pow(0.5 / w, 2), tx = std::pow(zh / width / w, 2), ty = std::pow(zh / height / w, 2);
    {
        SumoPtr sumo(pSumoForm(nullptr, nullptr));
        SumoStateVector *s = pSumoStateVectorNew(sumo.get(), sumo->root, 9, nullptr, nullptr);
        const Plx_Matrix33 H = mat33({1.1, 0.1, 5, -0.1, 0.9, 3, 0, 0, 1});
        ASSERT_TRUE(bMotionInit(sumo.get(), s, TRACK_MODEL_AFFINE, &H));
        ASSERT_TRUE(bAddHomogObs(sumo.get(), s, TRACK_MODEL_AFFINE, &H, w, height, width, zh, nullptr));
        const double d[6] = {a, a, tx, a, a, ty};
        for (uint32_t i = 0; i < 6; ++i)
            for (uint32_t j = 0; j < 6; ++j)
                EXPECT_NEAR(plx_squmat_get(&sumo->obs_active->N, i, j), i == j ? d[i] : 0.0, 1e-12);
    }
    {
        SumoPtr sumo(pSumoForm(nullptr, nullptr));
        SumoStateVector *s = pSumoStateVectorNew(sumo.get(), sumo->root, 9, nullptr, nullptr);
        const Plx_Matrix33 H = mat33({2.2, 0.2, 10, -0.2, 1.8, 6, 0.002, 0.004, 2});
        ASSERT_TRUE(bMotionInit(sumo.get(), s, TRACK_MODEL_PROJ, &H));
        ASSERT_TRUE(bAddHomogObs(sumo.get(), s, TRACK_MODEL_PROJ, &H, w, height, width, zh, nullptr));
        double h[9], norm2 = 0;
        for (int i = 0; i < 9; ++i) h[i] = H.m[i / 3][i % 3] / 2.0, norm2 += h[i] * h[i];
        const double dd = std::pow(std::min(std::fabs(h[1]) * height + std::fabs(h[0]) * width,
                                            std::fabs(h[4]) * height + std::fabs(h[3]) * width) *
                                       0.25 / w / zh,
                                   2);
        const double diag[8] = {a, a, tx, a, a, ty, dd, dd};
        double e = 0;
        for (int i = 0; i < 8; ++i) e += h[i] * h[i] * diag[i];
        double P[9][9] = {};
        for (int i = 0; i < 8; ++i) {
            P[i][i] = diag[i];
            P[8][i] = P[i][8] = -h[i] * diag[i];
        }
        P[8][8] = e;
        const Plx_SquMatrix *N = &sumo->obs_active->N;
        for (int i = 0; i < 9; ++i)
            for (int j = 0; j < 9; ++j)
                EXPECT_NEAR(plx_squmat_get(N, i, j), P[i][j] * norm2, 1e-9 * (1 + std::fabs(P[i][j]))) << i << j;
        // The homography itself is its null direction: the prior leaves the scale free.
        for (int i = 0; i < 9; ++i) {
            double sum = 0;
            for (int j = 0; j < 9; ++j) sum += plx_squmat_get(N, i, j) * h[j];
            EXPECT_NEAR(sum, 0.0, 1e-9);
        }
    }
    SumoPtr sumo(pSumoForm(nullptr, nullptr));
    SumoStateVector *s = pSumoStateVectorNew(sumo.get(), sumo->root, 9, nullptr, nullptr);
    const Plx_Matrix33 I = mat33({1, 0, 0, 0, 1, 0, 0, 0, 1});
    ASSERT_TRUE(bMotionInit(sumo.get(), s, TRACK_MODEL_TRANSLATE, &I));
    EXPECT_TRUE(fails_with(bAddHomogObs(sumo.get(), s, TRACK_MODEL_TRANSLATE, &I, 0.0, height, width, zh, nullptr),
                           PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_TRUE(fails_with(bAddHomogObs(sumo.get(), s, TRACK_MODEL_TRANSLATE, &I, w, 0, width, zh, nullptr),
                           PLX_ERROR_DIVISION_BY_ZERO));
}

// ---- block observations ----

struct BlockCase {
    SumoPtr sumo{pSumoForm(nullptr, nullptr)};
    Plx_MemoryStack ms{};
    ImagePtr image;
    TrackPixelObsJob job{};
    BlockCase(Plx_ImageFormat format, uint32_t model, int32_t size)
    {
        plx_memory_stack_form(&ms, 0, 1 << 16);
        image = float_image(size, size, format);
        SumoStateVector *s = pSumoStateVectorNew(sumo.get(), sumo->root, 9, &ms, nullptr);
        const Plx_Matrix33 I = mat33({1, 0, 0, 0, 1, 0, 0, 0, 1});
        EXPECT_TRUE(bMotionInit(sumo.get(), s, model, &I));
        job.sumo = sumo.get();
        job.ms = &ms;
        job.homography_state = s;
        job.model = model;
        job.reference = job.search = image.get();
        job.zh = 1.0;
        job.block_size = 2;
        job.sampling = 1;
        job.intensity_sigma = 0.5;
    }
    ~BlockCase()
    {
        sumo.reset();
        plx_memory_stack_free(&ms);
    }
    std::vector<uint32_t> counts() const
    {
        std::vector<uint32_t> n;
        for (uint32_t i = 0; i < job.no_obs; ++i) n.push_back(job.blocks[i].no_pixels);
        return n;
    }
};

TEST(TrackHomogBlocks, BlocksFollowSizeSamplingMaskAndTexture)
{
    {
        BlockCase bc(PLX_FORMAT_GREY, TRACK_MODEL_AFFINE, 5);
        ASSERT_TRUE(bBuildPixelObservations(&bc.job, nullptr));
        EXPECT_EQ(bc.job.blocks_across, 3u);
        EXPECT_EQ(bc.job.blocks_down, 3u);
        EXPECT_EQ(bc.counts(), (std::vector<uint32_t>{4, 4, 2, 4, 4, 2, 2, 2, 1}));
        // Block (1, 0) covers columns 2..3 of rows 0..1; values and N come from the pixels.
        const TrackPixelBlock &b = bc.job.blocks[1];
        EXPECT_EQ(b.positions[0], 2.5f);
        EXPECT_EQ(b.positions[1], 0.5f);
        EXPECT_EQ(bc.job.obs[1]->z.v.data[0], double(static_cast<float *>(plx_image_row(bc.image.get(), 0))[2]));
        EXPECT_NEAR(plx_squmat_get(&bc.job.obs[1]->N, 3, 3), 4.0, 1e-12);
        EXPECT_EQ(bc.job.obs[1]->kind, SUMO_OBS_H);
    }
    {
        BlockCase bc(PLX_FORMAT_GREY, TRACK_MODEL_AFFINE, 5);
        bc.job.sampling = 2;  // checkerboard: 13 of 25
        bc.job.robust_scale = 3.0;
        bc.job.outlier_cutoff = 2.0;
        ASSERT_TRUE(bBuildPixelObservations(&bc.job, nullptr));
        EXPECT_EQ(bc.counts(), (std::vector<uint32_t>{2, 2, 1, 2, 2, 1, 1, 1, 1}));
        EXPECT_EQ(bc.job.obs[0]->kind, SUMO_OBS_H_ROBUST);
        EXPECT_DOUBLE_EQ(bc.job.obs[0]->variance_scaling, 9.0);
        EXPECT_DOUBLE_EQ(bc.job.obs[0]->chi2_cutoff, 4.0);
    }
    {
        BlockCase bc(PLX_FORMAT_RGB, TRACK_MODEL_PROJ, 5);
        bc.job.sampling = 4;  // grid of step 2: one pixel per 2x2 block
        Plx_Image *mask = mask_without(5, 5, {{2, 2}});
        bc.job.reference_mask = mask;
        ASSERT_TRUE(bBuildPixelObservations(&bc.job, nullptr));
        EXPECT_EQ(bc.counts(), (std::vector<uint32_t>{1, 1, 1, 1, 1, 1, 1, 1}));
        EXPECT_EQ(bc.job.obs[0]->z.v.rows, 3u);
        plx_image_free(mask);
    }
    {
        // A flat image has no pixel textured enough.
        BlockCase bc(PLX_FORMAT_GREY, TRACK_MODEL_TRANSLATE, 6);
        const double half = 0.5;
        plx_image_fill_const(bc.image.get(), &half);
        bc.job.texture_threshold = 0.01;
        ASSERT_TRUE(bBuildPixelObservations(&bc.job, nullptr));
        EXPECT_EQ(bc.job.no_obs, 0u);
    }
}

TEST(TrackHomogBlocks, RefusesColourModelsWithoutAFunction)
{
    BlockCase bc(PLX_FORMAT_RGB, TRACK_MODEL_TRANS_SCALE, 5);
    EXPECT_TRUE(fails_with(bBuildPixelObservations(&bc.job, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    BlockCase grey(PLX_FORMAT_GREY, TRACK_MODEL_AFFINE, 5);
    grey.job.intensity_sigma = 0.0;
    EXPECT_TRUE(fails_with(bBuildPixelObservations(&grey.job, nullptr), PLX_ERROR_DIVISION_BY_ZERO));
}

// ---- constraint points and angles ----

TEST(TrackHomogConstraints, PointFunctionsMatchCentralDifferences)
{
    const std::pair<std::vector<double>, int32_t> states[] = {
        {{1.0, 0.02, 3.0, -0.01, 0.98, 2.0, 0.001, -0.002, 1.0}, TRACK_STATE_PROJ},
        {{1.01, 3.0, 0.02, 2.0}, TRACK_STATE_TRANS_ROT_SCALE},
        {{0.99, 3.0, 2.0}, TRACK_STATE_TRANS_SCALE},
        {{3.0, 2.0}, TRACK_STATE_TRANSLATE},
    };
    for (const auto &[x, type] : states) {
        SCOPED_TRACE(type);
        SumoPtr sumo(pSumoForm(nullptr, nullptr));
        SumoStateVector *s[2] = {make_state(sumo.get(), x, type), make_state(sumo.get(), {14.0, 9.0}, 257)};
        double zh = 2.0;
        double z2[4] = {5.0, 7.0, 11.0, 13.0};
        SumoVector zv{};
        plx_vec_form_data(&zv.v, 4, z2);
        zv.user_data = &zh;
        TrackConstraintPointData data{2.0, 2.0f, {1.5, -2.5}};
        SumoVector zo{};
        plx_vec_form_data(&zo.v, 2, z2);
        zo.user_data = &data;
        struct Fn {
            SumoFFunction f;
            SumoVector *z;
            uint32_t n;
        } fns[] = {{bConstraintPointTwoImagesF, &zv, 1}, {bConstraintPointOneImageF, &zo, 2}};
        for (const Fn &fn : fns) {
            const uint32_t m = fn.z->v.rows;
            Plx_Vector F{}, Fp{}, Fm{};
            plx_vec_form(&F, m), plx_vec_form(&Fp, m), plx_vec_form(&Fm, m);
            Plx_Matrix J0{}, J1{}, Fz{};
            plx_mat_form(&J0, m, s[0]->x.v.rows), plx_mat_form(&J1, m, 2), plx_mat_form(&Fz, m, m);
            Plx_Matrix *J[2] = {&J0, &J1};
            ASSERT_TRUE(fn.f(nullptr, nullptr, s, fn.n, fn.z, &F, J, &Fz));
            ASSERT_EQ(F.rows, 2u);
            ASSERT_EQ(Fz.rows, 2u);
            ASSERT_EQ(Fz.cols, m);
            const double step = 1e-6;
            auto check = [&](double &v, auto analytic) {
                const double saved = v;
                v = saved + step;
                ASSERT_TRUE(fn.f(nullptr, nullptr, s, fn.n, fn.z, &Fp, nullptr, nullptr));
                v = saved - step;
                ASSERT_TRUE(fn.f(nullptr, nullptr, s, fn.n, fn.z, &Fm, nullptr, nullptr));
                v = saved;
                for (uint32_t r = 0; r < 2; ++r)
                    EXPECT_NEAR(analytic(r), (Fp.data[r] - Fm.data[r]) / (2 * step), 1e-6);
            };
            for (uint32_t k = 0; k < s[0]->x.v.rows; ++k)
                check(s[0]->x.v.data[k], [&](uint32_t r) { return J0.data[r * J0.cols + k]; });
            if (fn.n == 2)
                for (uint32_t k = 0; k < 2; ++k)
                    check(s[1]->x.v.data[k], [&](uint32_t r) { return J1.data[r * 2 + k]; });
            for (uint32_t k = 0; k < m; ++k) check(fn.z->v.data[k], [&](uint32_t r) { return Fz.data[r * m + k]; });
            plx_vec_free(&F), plx_vec_free(&Fp), plx_vec_free(&Fm);
            plx_mat_free(&J0), plx_mat_free(&J1), plx_mat_free(&Fz);
        }
    }
}

TEST(TrackHomogConstraints, AngleValueDerivativesAndDegenerateCases)
{
    const double P[2] = {0, 0}, A[2] = {1, 0}, B[2] = {0, 1};
    double angle = 0, d[6];
    ASSERT_TRUE(bCalcConstraintAngle(P, A, B, 0.0, &angle, d, nullptr));
    EXPECT_NEAR(angle, -std::numbers::pi / 2, 1e-15);

    // Derivatives against central differences at a general configuration.
    double pts[6] = {1.0, 2.0, 4.0, 3.5, -0.5, 6.0};
    ASSERT_TRUE(bCalcConstraintAngle(pts, pts + 2, pts + 4, 0.0, &angle, d, nullptr));
    for (int k = 0; k < 6; ++k) {
        const double saved = pts[k], step = 1e-6;
        double ap, am;
        pts[k] = saved + step;
        bCalcConstraintAngle(pts, pts + 2, pts + 4, 0.0, &ap, nullptr, nullptr);
        pts[k] = saved - step;
        bCalcConstraintAngle(pts, pts + 2, pts + 4, 0.0, &am, nullptr, nullptr);
        pts[k] = saved;
        EXPECT_NEAR(d[k], (ap - am) / (2 * step), 1e-7) << k;
    }

    // Coinciding points: code 18 in the trace, or 29 in the caller's slot with the trace left alone.
    EXPECT_TRUE(fails_with(bCalcConstraintAngle(P, P, B, 0.0, &angle, d, nullptr), PLX_ERROR_DIVISION_BY_ZERO));
    plx_err_flush_trace();
    int32_t code = 0;
    EXPECT_FALSE(bCalcConstraintAngle(P, A, B, 1.5, &angle, d, &code));
    EXPECT_EQ(code, PLX_ERROR_UNDEFINED_ANGLE);
    EXPECT_EQ(plx_err_get_error_count(), 0u);

    // The observation function: prediction within pi of z, Jacobians matching.
    SumoPtr sumo(pSumoForm(nullptr, nullptr));
    // u = (-4, 0.1), v = (4, 0.1): the raw angle is just below +pi.
    SumoStateVector *s[3] = {make_state(sumo.get(), {1.0, 2.0}, 257), make_state(sumo.get(), {-3.0, 2.1}, 257),
                             make_state(sumo.get(), {5.0, 2.1}, 257)};
    double zval = -3.0, threshold = 0.0;
    SumoVector z{};
    plx_vec_form_data(&z.v, 1, &zval);
    z.user_data = &threshold;
    Plx_Vector h{};
    plx_vec_form(&h, 1);
    ASSERT_TRUE(bAngleConstraintH(nullptr, nullptr, s, 3, &z, &h, nullptr));
    const double raw = std::atan2(0.8, -15.99);
    EXPECT_NEAR(h.data[0], raw - 2 * std::numbers::pi, 1e-12);
    expect_jacobians(bAngleConstraintH, s, 3, z, 1e-6, 1e-6);
    plx_vec_free(&h);
}

// ---- whole levels on synthetic frames ----

Plx_Matrix33 mult(const Plx_Matrix33 &A, const Plx_Matrix33 &B)
{
    Plx_Matrix33 C;
    plx_mat33_rmultm33_s(&A, &B, &C);
    return C;
}

Plx_Matrix33 about_centre(const Plx_Matrix33 &L, double cx, double cy, double tx, double ty)
{
    return mult(mat33({1, 0, cx + tx, 0, 1, cy + ty, 0, 0, 1}), mult(L, mat33({1, 0, -cx, 0, 1, -cy, 0, 0, 1})));
}

void apply(const Plx_Matrix33 &H, double x, double y, double *u, double *v)
{
    const double X = H.m[0][0] * x + H.m[0][1] * y + H.m[0][2];
    const double Y = H.m[1][0] * x + H.m[1][1] * y + H.m[1][2];
    const double Z = H.m[2][0] * x + H.m[2][1] * y + H.m[2][2];
    *u = X / Z, *v = Y / Z;
}

constexpr int32_t kSize = 96, kBox0 = 28, kBox = 40, kSearch = 8;

// Two frames: the previous samples the texture, the current samples it moved by H.
struct Frames {
    ImagePtr previous, current;
    ImagePtr mask;
    Plx_Camera camera{};
    explicit Frames(const Plx_Matrix33 &H, double (*tex)(double, double) = texture)
    {
        previous.reset(plx_image_form_gen_gl_f(nullptr, kSize, kSize));
        current.reset(plx_image_form_gen_gl_f(nullptr, kSize, kSize));
        Plx_Matrix33 Hinv;
        plx_mat33_invert_s(&H, &Hinv);
        for (int32_t r = 0; r < kSize; ++r)
            for (int32_t c = 0; c < kSize; ++c) {
                double x, y;
                apply(Hinv, c + 0.5, r + 0.5, &x, &y);
                static_cast<float *>(plx_image_row(previous.get(), r))[c] = float(tex(c + 0.5, r + 0.5));
                static_cast<float *>(plx_image_row(current.get(), r))[c] = float(tex(x, y));
            }
        mask.reset(plx_image_form_gen_b(nullptr, kSize, kSize));
        plx_image_fill_zero(mask.get());
        const double one = 1.0;
        plx_image_fill_const_window(mask.get(), Plx_Window{kBox0, kBox0, kBox, kBox}, &one);
        plx_camera_build_linear(&camera, 1.0, 1.0, 1.0, 0.0, 0.0);
    }
};

void add_noise(Plx_Image *image, float sigma, unsigned seed)
{
    std::mt19937 rng(seed);
    std::normal_distribution<float> noise(0.f, sigma);
    for (int32_t r = 0; r < image->height; ++r)
        for (int32_t c = 0; c < image->width; ++c) static_cast<float *>(plx_image_row(image, r))[c] += noise(rng);
}

struct Settings {
    uint32_t model = TRACK_MODEL_AFFINE;
    double texture_threshold = 0.0;
    uint32_t min_pixel_count = 10;
    double max_rejected_fraction = 0.0;
    double robust_scale = 0.0;
    double outlier_cutoff = 0.0;
    uint32_t levels = 2;
};

using TrackPtr = std::unique_ptr<Track, Deleter<vTrackFree>>;

// A region starting at the identity; mask, correlation and template storage default to the
// frames' mask and the track's own.
TrackRegion *add_region(Track *track, Frames &f, const Settings &s, const ThreadHostInterface *host,
                        Plx_Image *mask = nullptr, Plx_Image *correlation = nullptr, Plx_Image *templ = nullptr)
{
    const Plx_Matrix33 I = mat33({1, 0, 0, 0, 1, 0, 0, 0, 1});
    return pTrackRegion(track, mask ? mask : f.mask.get(), f.previous.get(), &f.camera, nullptr, nullptr, &I, nullptr,
                        nullptr, 0.0, TRACK_NO_CORRELATION, 0.0, 0.0, 1.0, kSearch, kSearch, s.model, 0.5,
                        s.texture_threshold, 0.0, s.min_pixel_count, 0.0, 1, s.max_rejected_fraction, 1, 0.0, 8, 0.01,
                        s.robust_scale, s.outlier_cutoff, correlation, templ, nullptr, nullptr, nullptr, nullptr,
                        nullptr, nullptr, nullptr, host);
}

TrackPtr make_track(Frames &f, const Settings &s, const ThreadHostInterface *host = nullptr)
{
    TrackPtr track(pTrackNew(f.previous.get(), &f.camera, f.current.get(), &f.camera, s.levels, nullptr));
    EXPECT_NE(track, nullptr);
    EXPECT_NE(add_region(track.get(), f, s, host), nullptr);
    return track;
}

// Largest distance, over the region's corners, between where the region's window homography
// and the true one carry a reference point.
double corner_error(const TrackRegion *region, const Plx_Matrix33 &truth, int32_t x0 = kBox0, int32_t y0 = kBox0,
                    int32_t size = kBox)
{
    double worst = 0;
    for (double y : {double(y0), double(y0 + size)})
        for (double x : {double(x0), double(x0 + size)}) {
            double u, v, ue, ve;
            apply(truth, x, y, &u, &v);
            apply(region->homography, x - region->template_origin[0], y - region->template_origin[1], &ue, &ve);
            worst = std::max(worst, std::hypot(ue + region->search_origin[0] - u, ve + region->search_origin[1] - v));
        }
    return worst;
}

TEST(TrackHomogMatch, RecoversKnownMotionForEveryModel)
{
    const double c = kBox0 + kBox / 2.0, th = 0.02;
    const struct {
        uint32_t model;
        Plx_Matrix33 H;
    } cases[] = {
        {TRACK_MODEL_TRANSLATE, mat33({1, 0, 1.3, 0, 1, -0.7, 0, 0, 1})},
        {TRACK_MODEL_TRANS_SCALE, about_centre(mat33({1.02, 0, 0, 0, 1.02, 0, 0, 0, 1}), c, c, 0.8, 0.5)},
        {TRACK_MODEL_TRANS_ROT_SCALE,
         about_centre(mat33({1.01 * std::cos(th), -1.01 * std::sin(th), 0, 1.01 * std::sin(th), 1.01 * std::cos(th), 0,
                             0, 0, 1}),
                      c, c, -0.9, 1.1)},
        {TRACK_MODEL_AFFINE, about_centre(mat33({1.02, 0.015, 0, -0.01, 0.985, 0, 0, 0, 1}), c, c, 1.2, 0.6)},
        {TRACK_MODEL_PROJ, about_centre(mat33({1.015, 0.01, 0, -0.01, 0.99, 0, 2e-4, -1.5e-4, 1}), c, c, 0.7, -1.0)},
    };
    for (const auto &cs : cases) {
        SCOPED_TRACE(cs.model);
        Frames f(cs.H);
        Settings s;
        s.model = cs.model;
        TrackPtr track = make_track(f, s);
        auto *region = static_cast<TrackRegion *>(track->regions->head->data);
        EXPECT_GT(corner_error(region, cs.H), 0.5);
        ASSERT_TRUE(bTrackHomogOptimise(track.get(), 30, 1e-3, 10.0, nullptr, nullptr));
        EXPECT_LT(corner_error(region, cs.H), 0.05);
        EXPECT_EQ(region->status, TRACK_REGION_OK);
        // Bilinear interpolation flattens the search samples a little; the gain makes up for it.
        EXPECT_NEAR(region->gain, 1.0, 0.04);
        EXPECT_NEAR(region->offset, 0.0, 0.02);
        EXPECT_LT(region->rms_residual, 3.0);
        EXPECT_EQ(region->rejected_fraction, 0.0);
        ASSERT_NE(region->observation_mask, nullptr);
        EXPECT_GT(plx_image_bit_count(region->observation_mask), 1000u);
        const uint32_t params[5] = {6, 9, 2, 4, 3};
        EXPECT_EQ(region->information->size, params[cs.model]);
        EXPECT_GT(plx_squmat_get(region->information, 0, 0), 0.0);
        EXPECT_EQ(region->state, nullptr);
    }
}

// Noise in the current frame must not pull the estimate towards half-pixel positions (where
// interpolation averages the most noise away): a shift with quarter-pixel fractions comes
// back without bias, averaged over noise draws.
TEST(TrackHomogMatch, NoiseDoesNotPullTowardsHalfPixels)
{
    const Plx_Matrix33 H = mat33({1, 0, 1.25, 0, 1, -0.75, 0, 0, 1});
    const int draws = 16;
    double bias[2] = {0, 0};
    for (int d = 0; d < draws; ++d) {
        Frames f(H);
        add_noise(f.current.get(), 0.04f, 11 + d);
        Settings s;
        s.model = TRACK_MODEL_TRANSLATE;
        TrackPtr track = make_track(f, s);
        auto *region = static_cast<TrackRegion *>(track->regions->head->data);
        ASSERT_TRUE(bTrackHomogOptimise(track.get(), 30, 1e-3, 10.0, nullptr, nullptr));
        const double x = kBox0 + kBox / 2.0, y = x;
        double u, v;
        apply(region->homography, x - region->template_origin[0], y - region->template_origin[1], &u, &v);
        bias[0] += (u + region->search_origin[0] - (x + 1.25)) / draws;
        bias[1] += (v + region->search_origin[1] - (y - 0.75)) / draws;
    }
    // The derivatives of the interpolant itself lean 0.015 to 0.035 pixels towards the half
    // pixel here; the spread of the mean over the draws is about 0.004.
    EXPECT_LT(std::fabs(bias[0]), 0.015);
    EXPECT_LT(std::fabs(bias[1]), 0.015);
}

// Two regions handed the same caller buffers: each keeps its own pixel images.
TEST(TrackHomogMatch, RegionsSharingBuffersTrackIndependently)
{
    const double c = kBox0 + kBox / 2.0;
    const Plx_Matrix33 H = about_centre(mat33({1.01, 0.01, 0, -0.01, 0.99, 0, 0, 0, 1}), c, c, 0.9, -0.6);
    Frames f(H);
    TrackPtr track(pTrackNew(f.previous.get(), &f.camera, f.current.get(), &f.camera, 2, nullptr));
    ImagePtr mask_b(plx_image_form_gen_b(nullptr, kSize, kSize));
    plx_image_fill_zero(mask_b.get());
    const double one = 1.0;
    plx_image_fill_const_window(mask_b.get(), Plx_Window{10, 56, 30, 30}, &one);
    ImagePtr corr(plx_image_form_gen_gl_f(nullptr, 1, 1)), tmpl(plx_image_form_gen_gl_f(nullptr, 1, 1));
    for (Plx_Image *mask : {f.mask.get(), mask_b.get()})
        ASSERT_NE(add_region(track.get(), f, Settings{}, nullptr, mask, corr.get(), tmpl.get()), nullptr);
    ASSERT_TRUE(bTrackHomogOptimise(track.get(), 30, 1e-3, 10.0, nullptr, nullptr));
    auto *b = static_cast<TrackRegion *>(track->regions->head->data);
    auto *a = static_cast<TrackRegion *>(track->regions->head->next->data);
    EXPECT_LT(corner_error(a, H), 0.05);
    EXPECT_LT(corner_error(b, H, 10, 56, 30), 0.05);
}

TEST(TrackHomogMatch, NoIterationsKeepsTheMotionButMakesStatistics)
{
    Frames f(mat33({1, 0, 1.3, 0, 1, -0.7, 0, 0, 1}));
    Settings s;
    s.levels = 1;
    TrackPtr track = make_track(f, s);
    auto *region = static_cast<TrackRegion *>(track->regions->head->data);
    const Plx_Matrix33 before = region->homography;
    ASSERT_TRUE(bMatchImages(track.get(), 0, 1e-3, 10.0, 0, nullptr, nullptr));
    for (int i = 0; i < 9; ++i) EXPECT_EQ(region->homography.m[i / 3][i % 3], before.m[i / 3][i % 3]);
    ASSERT_NE(region->observation_mask, nullptr);
    EXPECT_EQ(plx_image_bit_count(region->observation_mask), uint32_t(kBox * kBox));
    EXPECT_GT(region->rms_residual, 1.0);
    EXPECT_LT(region->rms_residual, DBL_MAX);
    EXPECT_EQ(region->rejected_fraction, 0.0);
    EXPECT_EQ(region->status, TRACK_REGION_OK);
}

double flat(double, double) { return 0.5; }

// A textureless region has too few pixels. With a bright square over part of the region in
// the current frame, the blocks it covers become outliers: the region is lost only when a
// maximum rejected fraction is set.
TEST(TrackHomogMatch, StatusFollowsPixelCountAndRejectedFraction)
{
    const Plx_Matrix33 H = mat33({1, 0, 0.6, 0, 1, -0.4, 0, 0, 1});
    for (double maximum : {-1.0, 0.0, 0.01}) {
        SCOPED_TRACE(maximum);
        const bool textureless = maximum < 0;
        Frames f(textureless ? mat33({1, 0, 0, 0, 1, 0, 0, 0, 1}) : H, textureless ? flat : texture);
        const double bright = 0.95;
        plx_image_fill_const_window(f.current.get(), Plx_Window{kBox0 + 4, kBox0 + 4, 12, 12}, &bright);
        Settings s;
        s.model = TRACK_MODEL_TRANSLATE;
        s.texture_threshold = textureless ? 0.01 : 0.0;
        s.robust_scale = 10.0;
        s.outlier_cutoff = 9.0;
        s.max_rejected_fraction = std::max(maximum, 0.0);
        TrackPtr track = make_track(f, s);
        auto *region = static_cast<TrackRegion *>(track->regions->head->data);
        ASSERT_TRUE(bTrackHomogOptimise(track.get(), 30, 1e-3, 10.0, nullptr, nullptr));
        if (textureless) {
            EXPECT_EQ(region->status, TRACK_REGION_TOO_FEW_PIXELS);
            EXPECT_EQ(region->rms_residual, DBL_MAX);
            EXPECT_EQ(region->rejected_fraction, DBL_MAX);
            continue;
        }
        EXPECT_LT(corner_error(region, H), 0.05);
        if (maximum == 0.0) {
            EXPECT_EQ(region->status, TRACK_REGION_OK);
            EXPECT_GT(region->rejected_fraction, 0.05);
            EXPECT_LT(region->rejected_fraction, 0.3);
            EXPECT_LT(plx_image_bit_count(region->observation_mask), uint32_t(kBox * kBox * 0.95));
        } else {
            EXPECT_EQ(region->status, TRACK_REGION_LOST);
            EXPECT_EQ(region->rejected_fraction, DBL_MAX);
        }
    }
}

// Threaded builds, costs and the final elimination compute their terms over several jobs; the
// motion, residual and information must come out with the same bits as without a host.
TEST(TrackHomogMatch, SameBitsWithoutAHostAndForOneAndFourJobs)
{
    const double c = kBox0 + kBox / 2.0;
    const Plx_Matrix33 H = about_centre(mat33({1.02, 0.015, 0, -0.01, 0.985, 0, 0, 0, 1}), c, c, 1.2, 0.6);
    std::vector<double> reference;
    for (uint32_t jobs : {0u, 1u, 4u}) {
        HostPtr host(jobs ? plano_host_new(jobs) : nullptr);
        const ThreadHostInterface *iface = jobs ? plano_host_interface(host.get()) : nullptr;
        Frames f(H);
        TrackPtr track = make_track(f, Settings{}, iface);
        auto *region = static_cast<TrackRegion *>(track->regions->head->data);
        ASSERT_TRUE(bTrackHomogOptimise(track.get(), 30, 1e-3, 10.0, iface, nullptr));
        std::vector<double> result(&region->homography.m[0][0], &region->homography.m[0][0] + 9);
        result.push_back(region->rms_residual);
        for (uint32_t i = 0; i < region->information->size; ++i)
            for (uint32_t j = 0; j < region->information->size; ++j)
                result.push_back(plx_squmat_get(region->information, i, j));
        if (jobs == 0) reference = result;
        ASSERT_EQ(result.size(), reference.size());
        EXPECT_EQ(std::memcmp(result.data(), reference.data(), sizeof(double) * result.size()), 0) << jobs << " jobs";
    }
}

TEST(TrackHomogMatch, InterruptKeepsTheLevelsStartingMotion)
{
    HostPtr host(plano_host_new(2));
    plano_host_request_interrupt(host.get(), 1);
    Frames f(mat33({1, 0, 1.3, 0, 1, -0.7, 0, 0, 1}));
    TrackPtr track = make_track(f, Settings{}, plano_host_interface(host.get()));
    auto *region = static_cast<TrackRegion *>(track->regions->head->data);
    const Plx_Matrix33 before = region->homography;
    StatusTime st{100.0, 0.0};
    ASSERT_TRUE(bTrackHomogOptimise(track.get(), 30, 1e-3, 10.0, plano_host_interface(host.get()), &st));
    for (int i = 0; i < 9; ++i) EXPECT_EQ(region->homography.m[i / 3][i % 3], before.m[i / 3][i % 3]);
    EXPECT_GT(st.done, 0.0);
    EXPECT_EQ(region->observation_mask, nullptr);
}

// Once the cost cannot be told apart from its floor, a rejected step ends the level: the
// iterations allowed are a limit, not a count. Progress advances once per iteration, 0.2 of
// the track's status range at level 1 and 0.6 at level 0.
TEST(TrackHomogMatch, ConvergedLevelEndsBeforeTheIterationLimit)
{
    HostPtr host(plano_host_new(1));
    Frames f(mat33({1, 0, 1.3, 0, 1, -0.7, 0, 0, 1}));
    add_noise(f.current.get(), 0.02f, 3);
    TrackPtr track = make_track(f, Settings{}, plano_host_interface(host.get()));
    auto *region = static_cast<TrackRegion *>(track->regions->head->data);
    StatusTime st{1e9, 0.0};
    ASSERT_TRUE(bTrackHomogOptimise(track.get(), 200, 1e-3, 10.0, plano_host_interface(host.get()), &st));
    EXPECT_LT(corner_error(region, mat33({1, 0, 1.3, 0, 1, -0.7, 0, 0, 1})), 0.1);
    EXPECT_GT(st.done, 0.0);
    EXPECT_LT(st.done, 20 * 0.8 * track->status_range);  // at most 20 iterations a level
}

// Two regions sharing a constraint point whose target is estimated: the estimate lands where
// the true motion carries the point.
TEST(TrackHomogMatch, EstimatesConstraintTarget)
{
    const Plx_Matrix33 H = mat33({1, 0, 1.3, 0, 1, -0.7, 0, 0, 1});
    Frames f(H);
    Settings s;
    s.model = TRACK_MODEL_TRANSLATE;
    TrackPtr track = make_track(f, s);
    auto *a = static_cast<TrackRegion *>(track->regions->head->data);
    const double ref[2] = {40.0, 50.0}, info[3] = {4.0, 0.0, 4.0};
    TrackConstraintPoint *p = pTrackConstraintPointNRegions(track.get(), &a, 1, ref, info, nullptr, info);
    ASSERT_NE(p, nullptr);
    ASSERT_TRUE(bTrackHomogOptimise(track.get(), 30, 1e-3, 10.0, nullptr, nullptr));
    EXPECT_NEAR(p->target_point[0], 41.3, 0.05);
    EXPECT_NEAR(p->target_point[1], 49.3, 0.05);
    EXPECT_GT(p->target_information[0], 0.0);
    EXPECT_EQ(p->target_state, nullptr);
}

TEST(TrackHomogMatch, FailuresAreReported)
{
    EXPECT_TRUE(fails_with(bTrackHomogOptimise(nullptr, 1, 1e-3, 10.0, nullptr, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    Frames f(mat33({1, 0, 0, 0, 1, 0, 0, 0, 1}));
    Settings s;
    TrackPtr track = make_track(f, s);
    auto *region = static_cast<TrackRegion *>(track->regions->head->data);
    // An affine region whose homography has left its shape.
    region->homography.m[2][0] = 1e-3;
    EXPECT_TRUE(fails_with(bTrackHomogOptimise(track.get(), 1, 1e-3, 10.0, nullptr, nullptr), PLX_ERROR_INCOMPATIBLE));
    region->homography.m[2][0] = 0.0;
    region->settings.intensity_sigma = 0.0;
    EXPECT_TRUE(fails_with(bTrackHomogOptimise(track.get(), 1, 1e-3, 10.0, nullptr, nullptr),
                           PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(region->state, nullptr);
    // A track without regions has nothing to do.
    TrackPtr empty(pTrackNew(f.previous.get(), &f.camera, f.current.get(), &f.camera, 2, nullptr));
    EXPECT_TRUE(bTrackHomogOptimise(empty.get(), 1, 1e-3, 10.0, nullptr, nullptr));
}

}  // namespace
