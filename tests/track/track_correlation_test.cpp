// The coarse correlation search: correlation images against a plain double reference, peak
// picking, chamfer distances, and the per-region search on real tracks.
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstring>
#include <functional>
#include <memory>
#include <random>
#include <vector>

#include "plano/track_correlation.h"
#include "plano_host/host.h"
#include "track_test_util.hpp"

namespace {

using namespace track_test;

// Scores (and overlaps, with a search mask) computed plainly in double from the formulas.
struct Reference {
    std::vector<double> score, overlap;
    int32_t h = 0, w = 0;
};

Reference reference(const Plx_Image *t, const Plx_Image *weight, const Plx_Image *s, const Plx_Image *smask)
{
    Reference ref;
    ref.h = s->height - t->height + 1;
    ref.w = s->width - t->width + 1;
    const int ch = t->format == PLX_FORMAT_GREY ? 1 : 3;
    double total = 0, nt = 0;
    for (int32_t r = 0; r < t->height; ++r)
        for (int32_t c = 0; c < t->width; ++c) {
            const double wv = weight ? px(weight, r, c) : 1.0;
            total += wv;
            for (int k = 0; k < ch; ++k) nt += wv * px(t, r, c, k) * px(t, r, c, k);
        }
    for (int32_t dy = 0; dy < ref.h; ++dy)
        for (int32_t dx = 0; dx < ref.w; ++dx) {
            double cc = 0, p = 0, q = 0, n = 0;
            for (int32_t r = 0; r < t->height; ++r)
                for (int32_t c = 0; c < t->width; ++c) {
                    const double wv = weight ? px(weight, r, c) : 1.0;
                    if (wv == 0 || (smask && px(smask, dy + r, dx + c) == 0)) continue;
                    n += wv;
                    for (int k = 0; k < ch; ++k) {
                        const double a = px(t, r, c, k), b = px(s, dy + r, dx + c, k);
                        cc += wv * a * b;
                        p += wv * a * a;
                        q += wv * b * b;
                    }
                }
            if (smask) {
                ref.score.push_back(p > 0 && q > 0 ? cc / std::sqrt(p * q) : 0);
                ref.overlap.push_back(total > 0 ? n / total : 0);
            } else {
                ref.score.push_back(q > 0 && nt > 0 ? cc / std::sqrt(nt) / std::sqrt(q) : 0);
            }
        }
    return ref;
}

void expect_matches(const Plx_Image *out, const Reference &ref, double tol)
{
    ASSERT_EQ(out->height, ref.h);
    ASSERT_EQ(out->width, ref.w);
    for (int32_t r = 0; r < ref.h; ++r)
        for (int32_t c = 0; c < ref.w; ++c) {
            const size_t i = size_t(r) * size_t(ref.w) + size_t(c);
            ASSERT_NEAR(px(out, r, c, 0), ref.score[i], tol) << r << "," << c;
            if (!ref.overlap.empty()) {
                ASSERT_NEAR(px(out, r, c, 1), ref.overlap[i], 1e-6) << r << "," << c;
            }
        }
}

// A random texture in [0, 1] of full scale, stored in the given type.
double full_scale(Plx_PixelType type)
{
    switch (type) {
    case PLX_TYPE_UCHAR: return 255;
    case PLX_TYPE_USHORT: return 65535;
    case PLX_TYPE_INT: return 1000000;
    case PLX_TYPE_UINT: return 3000000000.0;
    default: return 1;
    }
}

Image random_image(Plx_ImageFormat format, Plx_PixelType type, int32_t h, int32_t w, unsigned seed)
{
    std::mt19937 gen(seed);
    std::uniform_real_distribution<double> u(0.05, 1.0);
    const double scale = full_scale(type);
    const bool integral = type != PLX_TYPE_FLOAT && type != PLX_TYPE_DOUBLE;
    return make(format, type, h, w, [&](int32_t, int32_t, int) {
        const double v = u(gen) * scale;
        return integral ? std::round(v) : v;
    });
}

Image cut(const Plx_Image *im, int32_t y, int32_t x, int32_t h, int32_t w)
{
    Image out(plx_image_extract_q(im, Plx_Window{x, y, w, h}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 1, nullptr));
    out->x = out->y = 0;
    return out;
}

Image correlate(const ThreadHostInterface *host, const Plx_Image *t, const Plx_Image *weight, const Plx_Image *s,
                const Plx_Image *smask, double texture = 0)
{
    return Image(pgiTrackImageCorrelate2D_q(host, t, weight, s, smask, texture, nullptr, nullptr, 0));
}

class TrackCorrelation : public HostTest {};

TEST_F(TrackCorrelation, TemplateCutFromTheSearchImagePeaksWhereItWasCut)
{
    Image s = random_image(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 40, 50, 1);
    Image t = cut(s.get(), 7, 19, 16, 12);
    Image m = mask_of(40, 50, [](int32_t r, int32_t c) { return (r + 3 * c) % 7 != 0; });
    for (const Plx_Image *smask : {static_cast<const Plx_Image *>(nullptr), static_cast<const Plx_Image *>(m.get())}) {
        Image out = correlate(table(), t.get(), nullptr, s.get(), smask);
        ASSERT_NE(out, nullptr);
        EXPECT_EQ(out->type, PLX_TYPE_FLOAT);
        EXPECT_EQ(out->format, smask ? PLX_FORMAT_VECTOR2D : PLX_FORMAT_GREY);
        ASSERT_EQ(out->height, 25);
        ASSERT_EQ(out->width, 39);
        EXPECT_NEAR(px(out.get(), 7, 19), 1.0, 1e-5);
        int32_t row = -1, col = -1;
        double best = -1;
        ASSERT_TRUE(bGetBestCorrScore(out.get(), 0.0, 0.0, 0.0, &row, &col, &best));
        EXPECT_EQ(row, 7);
        EXPECT_EQ(col, 19);
        EXPECT_NEAR(best, 1.0, 1e-5);
    }
}

TEST_F(TrackCorrelation, EveryFormatAndTypeMatchesTheDoubleReference)
{
    const Plx_ImageFormat formats[] = {PLX_FORMAT_GREY, PLX_FORMAT_RGB, PLX_FORMAT_RGBA};
    const Plx_PixelType types[] = {PLX_TYPE_INT, PLX_TYPE_UCHAR, PLX_TYPE_USHORT,
                                   PLX_TYPE_UINT, PLX_TYPE_FLOAT, PLX_TYPE_DOUBLE};
    Image m = mask_of(14, 17, [](int32_t r, int32_t c) { return r < 9 || c > 4; });
    Image wbits = mask_of(6, 5, [](int32_t r, int32_t c) { return (r * c) % 3 != 1; });
    unsigned seed = 10;
    for (Plx_ImageFormat f : formats)
        for (Plx_PixelType ty : types) {
            SCOPED_TRACE(::testing::Message() << "format " << f << " type " << ty);
            Image s = random_image(f, ty, 14, 17, seed++);
            Image t = random_image(f, ty, 6, 5, seed++);
            const bool wide = ty == PLX_TYPE_INT || ty == PLX_TYPE_UINT || ty == PLX_TYPE_DOUBLE;
            const double tol = wide ? 1e-12 : 2e-5;
            Image plain = correlate(table(), t.get(), nullptr, s.get(), nullptr);
            ASSERT_NE(plain, nullptr);
            EXPECT_EQ(plain->type, wide ? PLX_TYPE_DOUBLE : PLX_TYPE_FLOAT);
            expect_matches(plain.get(), reference(t.get(), nullptr, s.get(), nullptr), tol);
            Image masked = correlate(table(), t.get(), wbits.get(), s.get(), m.get());
            ASSERT_NE(masked, nullptr);
            expect_matches(masked.get(), reference(t.get(), wbits.get(), s.get(), m.get()), tol);
        }
}

TEST_F(TrackCorrelation, SixteenBitWeightsAndWideSearchMasksMatchTheReference)
{
    // Wider than 64 pixels so that whole mask words, clear and set, occur at every offset.
    Image s = random_image(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 20, 150, 3);
    Image t = random_image(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 5, 9, 4);
    Image weight = make(PLX_FORMAT_GREY, PLX_TYPE_USHORT, 5, 9, [](int32_t r, int32_t c, int) {
        return double((r * 7 + c * 3) % 5);  // includes zeros
    });
    Image m = mask_of(20, 150, [](int32_t r, int32_t c) { return (c >= 40 && c < 100) || (c >= 120 && (r + c) % 3); });
    Image out = correlate(table(), t.get(), weight.get(), s.get(), m.get());
    ASSERT_NE(out, nullptr);
    const Reference ref = reference(t.get(), weight.get(), s.get(), m.get());
    expect_matches(out.get(), ref, 2e-5);
    // Offsets whose template lies over clear mask only have no overlap and score 0.
    EXPECT_EQ(px(out.get(), 0, 0, 1), 0.0);
    EXPECT_EQ(px(out.get(), 0, 0, 0), 0.0);
    EXPECT_NEAR(px(out.get(), 3, 50, 1), 1.0, 1e-6);
}

TEST_F(TrackCorrelation, ZeroTemplateAndEqualSizesGiveTheDegenerateAnswers)
{
    Image s = random_image(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 12, 12, 5);
    Image zero = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 4, 4, [](int32_t, int32_t, int) { return 0.0; });
    Image out = correlate(table(), zero.get(), nullptr, s.get(), nullptr);
    ASSERT_NE(out, nullptr);
    for (int32_t r = 0; r < 9; ++r)
        for (int32_t c = 0; c < 9; ++c) ASSERT_EQ(px(out.get(), r, c), 0.0);
    int32_t row = -1, col = -1;
    double best = -1;
    ASSERT_TRUE(bGetBestCorrScore(out.get(), 0, 0.0, 0, &row, &col, &best));
    EXPECT_EQ(best, 0.0);  // zero is not an acceptable peak: the region gets no match

    // An empty weight gives zeros too.
    Image none = mask_of(4, 4, [](int32_t, int32_t) { return false; });
    Image t = cut(s.get(), 2, 2, 4, 4);
    out = correlate(table(), t.get(), none.get(), s.get(), nullptr);
    ASSERT_NE(out, nullptr);
    EXPECT_EQ(px(out.get(), 2, 2), 0.0);

    Image same = correlate(table(), s.get(), nullptr, s.get(), nullptr);
    ASSERT_NE(same, nullptr);
    EXPECT_EQ(same->height, 1);
    EXPECT_EQ(same->width, 1);
    EXPECT_NEAR(px(same.get(), 0, 0), 1.0, 1e-6);
}

TEST_F(TrackCorrelation, ResultIsTheSameForAnyNumberOfJobs)
{
    Image s = random_image(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 60, 70, 6);
    Image t = random_image(PLX_FORMAT_RGB, PLX_TYPE_UCHAR, 11, 13, 7);
    Image m = mask_of(60, 70, [](int32_t r, int32_t c) { return (r * 13 + c * 7) % 11 != 0; });
    Image one = correlate(nullptr, t.get(), nullptr, s.get(), m.get());
    ASSERT_NE(one, nullptr);
    for (uint32_t jobs : {1u, 2u, 5u, 64u}) {
        plano_host_set_jobs(host_, jobs);
        Image many = correlate(table(), t.get(), nullptr, s.get(), m.get());
        ASSERT_NE(many, nullptr);
        for (int32_t r = 0; r < one->height; ++r)
            ASSERT_EQ(0, std::memcmp(plx_image_row(one.get(), r), plx_image_row(many.get(), r),
                                     size_t(one->width) * 2 * sizeof(float)))
                << "jobs " << jobs << " row " << r;
    }
}

TEST_F(TrackCorrelation, InterruptStopsAfterTheFirstRowAndProgressIsReported)
{
    Image s = random_image(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 30, 30, 8);
    Image t = cut(s.get(), 3, 3, 8, 8);
    plano_host_set_jobs(host_, 1);
    StatusTime st{10.0, 0.0};
    Image full(pgiTrackImageCorrelate2D_q(table(), t.get(), nullptr, s.get(), nullptr, 0, nullptr, &st, 4.0));
    ASSERT_NE(full, nullptr);
    EXPECT_NEAR(st.done, 4.0, 1e-9);
    EXPECT_GE(plano_host_last_progress(host_), 39);

    plano_host_request_interrupt(host_, 1);
    Image part = correlate(table(), t.get(), nullptr, s.get(), nullptr);
    plano_host_request_interrupt(host_, 0);
    ASSERT_NE(part, nullptr);
    EXPECT_EQ(px(part.get(), 0, 5), px(full.get(), 0, 5));
    for (int32_t r = 1; r < part->height; ++r)
        for (int32_t c = 0; c < part->width; ++c) ASSERT_EQ(px(part.get(), r, c), 0.0);
}

TEST_F(TrackCorrelation, TextureThresholdKeepsOnlySteepInteriorPixels)
{
    // A template flat except for one vertical edge: only pixels beside the edge are steep.
    Image t = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 7, 9, [](int32_t, int32_t c, int) { return c < 4 ? 40.0 : 200.0; });
    Image s = random_image(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 15, 16, 9);
    Image expected_weight = mask_of(7, 9, [](int32_t r, int32_t c) { return r > 0 && r < 6 && (c == 3 || c == 4); });
    Image out = correlate(table(), t.get(), nullptr, s.get(), nullptr, 0.5);  // (160)^2 >= (127.5)^2
    ASSERT_NE(out, nullptr);
    expect_matches(out.get(), reference(t.get(), expected_weight.get(), s.get(), nullptr), 2e-5);
    // Too high a threshold leaves no pixel: all zero.
    out = correlate(table(), t.get(), nullptr, s.get(), nullptr, 0.9);
    ASSERT_NE(out, nullptr);
    EXPECT_EQ(px(out.get(), 4, 4), 0.0);
    // A 16-bit weight keeps its values on the steep pixels.
    Image w16 = make(PLX_FORMAT_GREY, PLX_TYPE_USHORT, 7, 9, [](int32_t r, int32_t, int) { return double(r + 1); });
    Image expected16 = make(PLX_FORMAT_GREY, PLX_TYPE_USHORT, 7, 9, [](int32_t r, int32_t c, int) {
        return r > 0 && r < 6 && (c == 3 || c == 4) ? double(r + 1) : 0.0;
    });
    out = correlate(table(), t.get(), w16.get(), s.get(), nullptr, 0.5);
    ASSERT_NE(out, nullptr);
    expect_matches(out.get(), reference(t.get(), expected16.get(), s.get(), nullptr), 2e-5);
}

TEST_F(TrackCorrelation, BadArgumentsGetTheirCodes)
{
    Image s = random_image(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 10, 10, 11);
    Image t = cut(s.get(), 0, 0, 4, 4);
    Image ga = random_image(PLX_FORMAT_GREY_ALPHA, PLX_TYPE_UCHAR, 4, 4, 12);
    Image gas = random_image(PLX_FORMAT_GREY_ALPHA, PLX_TYPE_UCHAR, 10, 10, 12);
    EXPECT_TRUE(fails_with(correlate(nullptr, ga.get(), nullptr, gas.get(), nullptr), PLX_ERROR_ILLEGAL_FORMAT));
    Image bits = mask_of(4, 4, [](int32_t, int32_t) { return true; });
    Image sbits = mask_of(10, 10, [](int32_t, int32_t) { return true; });
    EXPECT_EQ(correlate(nullptr, bits.get(), nullptr, sbits.get(), nullptr), nullptr);
    EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_PIXEL_TYPE);
    EXPECT_EQ(correlate(nullptr, s.get(), nullptr, t.get(), nullptr), nullptr);  // search smaller
    EXPECT_EQ(origin_code(), PLX_ERROR_INCOMPATIBLE);
    Image sf = random_image(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 10, 10, 13);
    EXPECT_EQ(correlate(nullptr, t.get(), nullptr, sf.get(), nullptr), nullptr);  // type mismatch
    EXPECT_EQ(origin_code(), PLX_ERROR_INCOMPATIBLE);
    EXPECT_EQ(correlate(nullptr, t.get(), nullptr, s.get(), bits.get()), nullptr);  // mask size
    EXPECT_EQ(origin_code(), PLX_ERROR_INCOMPATIBLE);
    EXPECT_TRUE(fails_with(correlate(nullptr, nullptr, nullptr, s.get(), nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));

    // A worker handed an output of the wrong shape refuses it.
    Image wrong(plx_image_form_gen(nullptr, PLX_FORMAT_GREY, PLX_TYPE_DOUBLE, 7, 7));
    CorrelationJob job{nullptr, t.get(), nullptr, s.get(), nullptr, wrong.get(), 0, 7, nullptr, 0, nullptr};
    EXPECT_TRUE(fails_with(pgiImageCorrelate2D_gl_uc(&job), PLX_ERROR_INCOMPATIBLE));
    EXPECT_EQ(gbApplyCorrelationToWindow(&job), 0);
    // ... and a worker of another type refuses the job.
    EXPECT_TRUE(fails_with(pgiImageCorrelate2D_gl_f(&job), PLX_ERROR_INCOMPATIBLE));
}

// ---- peak picking ----

TEST(TrackCorrelationPeak, EqualMaximaGoToTheLargerRowThenColumn)
{
    Image c = make(PLX_FORMAT_GREY, PLX_TYPE_FLOAT, 5, 6, [](int32_t r, int32_t col, int) {
        return (r == 1 && col == 4) || (r == 3 && col == 1) || (r == 3 && col == 0) ? 0.9 : 0.1;
    });
    int32_t row = -1, col = -1;
    double best = -1;
    ASSERT_TRUE(bGetBestCorrScore(c.get(), 0, 0, 0, &row, &col, &best));
    EXPECT_EQ(row, 3);
    EXPECT_EQ(col, 1);
    EXPECT_NEAR(best, 0.9, 1e-7);
    // The starting best is a floor: nothing above it leaves everything as it was.
    row = col = -7;
    best = 0.95;
    ASSERT_TRUE(bGetBestCorrScore(c.get(), 0, 0, 0, &row, &col, &best));
    EXPECT_EQ(row, -7);
    EXPECT_EQ(best, 0.95);
    // The minimum score rejects everything below it.
    best = -1;
    ASSERT_TRUE(bGetBestCorrScore(c.get(), 0, 0.95, 0, &row, &col, &best));
    EXPECT_EQ(best, -1);
}

TEST(TrackCorrelationPeak, OverlapAndSharpnessDecideAcceptance)
{
    // Two components: a high score with too little overlap loses to a lower one.
    Image c = make(PLX_FORMAT_VECTOR2D, PLX_TYPE_DOUBLE, 5, 5, [](int32_t r, int32_t col, int k) {
        if (k == 1) return r == 0 && col == 0 ? 0.2 : 1.0;
        if (r == 0 && col == 0) return 0.99;
        if (r == 2 && col == 2) return 0.9;
        return 0.3;
    });
    int32_t row = -1, col = -1;
    double best = -1;
    ASSERT_TRUE(bGetBestCorrScore(c.get(), 0.5, 0, 0, &row, &col, &best));
    EXPECT_EQ(row, 2);
    EXPECT_EQ(col, 2);
    // Sharp enough: 0.9 - 0.3 = 0.6 in both axes, 0.45 - 0.15 = 0.3 on the diagonals.
    best = -1;
    ASSERT_TRUE(bGetBestCorrScore(c.get(), 0.5, 0, 0.3, &row, &col, &best));
    EXPECT_NEAR(best, 0.9, 1e-12);
    best = -1;
    ASSERT_TRUE(bGetBestCorrScore(c.get(), 0.5, 0, 0.31, &row, &col, &best));
    EXPECT_EQ(best, -1);
    EXPECT_EQ(row, 2);  // the peak is still reported
    // A peak on the border is never sharp.
    best = -1;
    ASSERT_TRUE(bGetBestCorrScore(c.get(), 0.0, 0, 0.01, &row, &col, &best));
    EXPECT_EQ(row, 0);
    EXPECT_EQ(col, 0);
    EXPECT_EQ(best, -1);

    Image bad(plx_image_form_gen(nullptr, PLX_FORMAT_RGB, PLX_TYPE_FLOAT, 2, 2));
    EXPECT_TRUE(fails_with(bGetBestCorrScore(bad.get(), 0, 0, 0, &row, &col, &best), PLX_ERROR_ILLEGAL_FORMAT));
    Image badtype(plx_image_form_gen(nullptr, PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 2, 2));
    EXPECT_TRUE(fails_with(bGetBestCorrScore(badtype.get(), 0, 0, 0, &row, &col, &best), PLX_ERROR_ILLEGAL_PIXEL_TYPE));
}

// ---- chamfer distances ----

TEST(TrackChamfer, RectangleByHandAndTheBruteForceDistance)
{
    // A full mask: 2 per straight and 3 per diagonal step to the ring outside the image.
    Image full = mask_of(5, 7, [](int32_t, int32_t) { return true; });
    Plx_Image d{};
    ASSERT_TRUE(bImageChamferMap(full.get(), &d));
    const int expected[5][7] = {{2, 2, 2, 2, 2, 2, 2},
                                {2, 4, 4, 4, 4, 4, 2},
                                {2, 4, 6, 6, 6, 4, 2},
                                {2, 4, 4, 4, 4, 4, 2},
                                {2, 2, 2, 2, 2, 2, 2}};
    ASSERT_EQ(d.type, PLX_TYPE_USHORT);
    for (int32_t r = 0; r < 5; ++r)
        for (int32_t c = 0; c < 7; ++c) EXPECT_EQ(px(&d, r, c), expected[r][c]) << r << "," << c;
    plx_image_free(&d);

    std::mt19937 gen(4);
    Image m = mask_of(13, 17, [&](int32_t r, int32_t) { return (gen() % 9 != 0) && r != 6; });
    ASSERT_TRUE(bImageChamferMap(m.get(), &d));
    for (int32_t r = 0; r < 13; ++r)
        for (int32_t c = 0; c < 17; ++c) {
            // The nearest clear pixel, the ring outside the image included: 2 max + min.
            int best = 1 << 30;
            for (int32_t y = -1; y <= 13; ++y)
                for (int32_t x = -1; x <= 17; ++x) {
                    const bool outside = y < 0 || x < 0 || y >= 13 || x >= 17;
                    if (!outside && px(m.get(), y, x) != 0) continue;
                    const int dy = std::abs(y - r), dx = std::abs(x - c);
                    best = std::min(best, 2 * std::max(dx, dy) + std::min(dx, dy));
                }
            ASSERT_EQ(px(&d, r, c), best) << r << "," << c;
        }
    plx_image_free(&d);
    Image grey(plx_image_form_gen(nullptr, PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 2, 2));
    EXPECT_TRUE(fails_with(bImageChamferMap(grey.get(), &d), PLX_ERROR_ILLEGAL_PIXEL_TYPE));
}

// ---- the coarse search of a region ----

// A smooth texture of Gaussian blobs, evaluated anywhere, so moved frames are exact.
struct Blobs {
    std::vector<std::array<double, 4>> blobs;  // x, y, sigma, amplitude
    explicit Blobs(unsigned seed)
    {
        std::mt19937 gen(seed);
        std::uniform_real_distribution<double> pos(-10, 170), sig(2.5, 6), amp(-90, 90);
        for (int i = 0; i < 260; ++i) blobs.push_back({pos(gen), pos(gen), sig(gen), amp(gen)});
    }
    double operator()(double x, double y) const
    {
        double v = 128;
        for (const auto &b : blobs) {
            const double dx = x - b[0], dy = y - b[1];
            if (std::fabs(dx) > 5 * b[2] || std::fabs(dy) > 5 * b[2]) continue;
            v += b[3] * std::exp(-(dx * dx + dy * dy) / (2 * b[2] * b[2]));
        }
        return std::clamp(v, 0.0, 255.0);
    }
};

// A 160 x 160 frame whose pixel (c, r) shows the texture at where(c, r).
Image frame(const Blobs &tex, const std::function<std::array<double, 2>(double, double)> &where)
{
    return make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 160, 160, [&](int32_t r, int32_t c, int) {
        const auto p = where(c, r);
        return std::round(tex(p[0], p[1]));
    });
}

struct RegionSetup {
    Image previous, current, mask, valid;
    Plx_Camera camera{};
    Track *track = nullptr;
    TrackRegion *region = nullptr;
    ~RegionSetup() { vTrackFree(track); }
    // One region over `mask`, identity starting motion.
    bool build(uint32_t levels, uint32_t correlation_size, double rotation_range, double rotation_step,
               uint32_t search, uint32_t model, const Plx_Matrix33 &h, bool with_valid_mask = false)
    {
        plx_camera_build_linear(&camera, 1.0, 1.0, 1.0, 0.0, 0.0);
        track = pTrackNew(previous.get(), &camera, current.get(), &camera, levels, nullptr);
        if (track == nullptr) return false;
        if (with_valid_mask) valid = mask_of(160, 160, [](int32_t, int32_t) { return true; });
        region = pTrackRegion(track, mask.get(), previous.get(), &camera, nullptr, valid.get(), &h, nullptr, nullptr,
                              0.0, correlation_size, rotation_range, 0.0, rotation_step, search, search, model, 0.5,
                              0.0, 0.3, 10, 0.0, 1, 0.0, 1, 0.0, 8, 0.01, 0.0, 9.0, nullptr, nullptr, nullptr,
                              nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr);
        return region != nullptr;
    }
};

const Plx_Matrix33 kIdentity{{{1, 0, 0}, {0, 1, 0}, {0, 0, 1}}};

TEST(TrackRegionOptimise, PlainSearchRecoversATranslation)
{
    const Blobs tex(21);
    RegionSetup s;
    s.previous = frame(tex, [](double x, double y) { return std::array<double, 2>{x, y}; });
    // What sits at (x, y) in the previous frame sits at (x + 5, y - 3) in the current one.
    s.current = frame(tex, [](double x, double y) { return std::array<double, 2>{x - 5, y + 3}; });
    s.mask = mask_of(160, 160, [](int32_t r, int32_t c) { return r >= 60 && r < 91 && c >= 50 && c < 85; });
    ASSERT_TRUE(s.build(3, 64, 0, 1, 9, TRACK_MODEL_TRANSLATE, kIdentity));
    const Plx_Matrix33 before = s.region->homography;
    PlanoHost *host = plano_host_new(2);
    StatusTime st{1.0, 0.0};
    ASSERT_TRUE(bTrackRegionOptimise(s.track, s.region, &st, 0.5, 0, plano_host_interface(host)));
    EXPECT_EQ(s.region->status, TRACK_REGION_OK);
    EXPECT_EQ(s.region->corr_offset[0], 5);
    EXPECT_EQ(s.region->corr_offset[1], -3);
    EXPECT_NEAR(s.region->homography.m[0][2] - before.m[0][2], 5, 1e-12);
    EXPECT_NEAR(s.region->homography.m[1][2] - before.m[1][2], -3, 1e-12);
    EXPECT_GT(s.region->corr_score, 0.99);
    EXPECT_NEAR(st.done, 0.5, 1e-9);

    // The host's correlation slot replaces the built-in correlation, with the same arguments.
    struct Counter {
        static Plx_Image *correlate(const ThreadHostInterface *h, const Plx_Image *t, const Plx_Image *w,
                                    const Plx_Image *sr, const Plx_Image *m, double tex_t, Plx_Image *result,
                                    StatusTime *time, double share)
        {
            ++*static_cast<int *>(h->unused7);
            return pgiTrackImageCorrelate2D_q(nullptr, t, w, sr, m, tex_t, result, time, share);
        }
    };
    int calls = 0;
    ThreadHostInterface table{};
    plano_host_fill(host, &table);
    table.correlation = Counter::correlate;
    table.unused7 = &calls;
    s.region->homography = before;
    ASSERT_TRUE(bTrackRegionOptimise(s.track, s.region, nullptr, 0.0, 0, &table));
    EXPECT_EQ(calls, 1);
    EXPECT_EQ(s.region->corr_offset[0], 5);
    vThreadedWorkerPoolFree();
    plano_host_free(host);
}

TEST(TrackRegionOptimise, CoarserLevelStillFindsTheShiftAndFlatRegionsGetNoMatch)
{
    const Blobs tex(5);
    RegionSetup s;
    s.previous = frame(tex, [](double x, double y) { return std::array<double, 2>{x, y}; });
    s.current = frame(tex, [](double x, double y) { return std::array<double, 2>{x + 6, y - 4}; });
    s.mask = mask_of(160, 160, [](int32_t r, int32_t c) { return r >= 50 && r < 111 && c >= 50 && c < 111; });
    // sqrt(61 x 61) = 61; 61 >> 1 = 30 > 16 and 61 >> 2 = 15 <= 16: level 1.
    ASSERT_TRUE(s.build(3, 16, 0, 1, 12, TRACK_MODEL_AFFINE, kIdentity));
    ASSERT_TRUE(bTrackRegionOptimise(s.track, s.region, nullptr, 0, 0, nullptr));
    EXPECT_EQ(s.region->status, TRACK_REGION_OK);
    EXPECT_EQ(s.region->corr_offset[0], -6);
    EXPECT_EQ(s.region->corr_offset[1], 4);

    RegionSetup flat;
    flat.previous = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 160, 160, [](int32_t, int32_t, int) { return 0.0; });
    flat.current = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 160, 160, [](int32_t, int32_t, int) { return 0.0; });
    flat.mask = mask_of(160, 160, [](int32_t r, int32_t c) { return r >= 50 && r < 71 && c >= 50 && c < 71; });
    ASSERT_TRUE(flat.build(2, 64, 0, 1, 5, TRACK_MODEL_AFFINE, kIdentity));
    const Plx_Matrix33 before = flat.region->homography;
    ASSERT_TRUE(bTrackRegionOptimise(flat.track, flat.region, nullptr, 0, 0, nullptr));
    EXPECT_EQ(flat.region->status, TRACK_REGION_NO_MATCH);
    EXPECT_EQ(std::memcmp(&before, &flat.region->homography, sizeof before), 0);
}

TEST(TrackRegionOptimise, SweepRecoversAFortyDegreeRotation)
{
    const Blobs tex(8);
    const double angle = 40.0 * M_PI / 180.0, cx = 80.5, cy = 80.5;
    RegionSetup s;
    s.previous = frame(tex, [](double x, double y) { return std::array<double, 2>{x, y}; });
    // The current frame is the previous one turned by 40 degrees about the region's centre.
    s.current = frame(tex, [&](double x, double y) {
        const double dx = x + 0.5 - cx, dy = y + 0.5 - cy;
        return std::array<double, 2>{cx - 0.5 + std::cos(angle) * dx + std::sin(angle) * dy,
                                     cy - 0.5 - std::sin(angle) * dx + std::cos(angle) * dy};
    });
    s.mask = mask_of(160, 160, [](int32_t r, int32_t c) {
        const double dx = c + 0.5 - 80.5, dy = r + 0.5 - 80.5;
        return dx * dx + dy * dy <= 22.0 * 22.0;
    });
    ASSERT_TRUE(s.build(2, 64, 0.8, 1.0, 6, TRACK_MODEL_TRANS_ROT_SCALE, kIdentity));
    ASSERT_TRUE(bTrackRegionOptimise(s.track, s.region, nullptr, 0, 0, nullptr));
    EXPECT_EQ(s.region->status, TRACK_REGION_OK);
    const Plx_Matrix33 &h = s.region->homography;
    EXPECT_NEAR(std::atan2(h.m[1][0], h.m[0][0]) * 180 / M_PI, 40.0, 1.5);
    EXPECT_NEAR(std::hypot(h.m[1][0], h.m[0][0]), 1.0, 1e-9);
    // The region's centre lands where it is in the current frame (search-window pixels).
    const double tx = cx - s.region->region_origin[0], ty = cy - s.region->region_origin[1];
    const double px_ = h.m[0][0] * tx + h.m[0][1] * ty + h.m[0][2];
    const double py_ = h.m[1][0] * tx + h.m[1][1] * ty + h.m[1][2];
    EXPECT_NEAR(px_, cx - s.region->search_origin[0], 1.5);
    EXPECT_NEAR(py_, cy - s.region->search_origin[1], 1.5);
}

TEST(TrackRegionOptimise, VisibilityOnlyMarksRegionsThatLeaveTheWindow)
{
    const Blobs tex(3);
    for (const double shift : {0.0, 60.0}) {
        RegionSetup s;
        s.previous = frame(tex, [](double x, double y) { return std::array<double, 2>{x, y}; });
        s.current = frame(tex, [](double x, double y) { return std::array<double, 2>{x, y}; });
        s.mask = mask_of(160, 160, [](int32_t r, int32_t c) { return r >= 40 && r < 61 && c >= 40 && c < 61; });
        const Plx_Matrix33 h{{{1, 0, shift}, {0, 1, 0}, {0, 0, 1}}};
        ASSERT_TRUE(s.build(2, TRACK_NO_CORRELATION, 0, 1, 4, TRACK_MODEL_AFFINE, h, true));
        PlanoHost *host = plano_host_new(1);
        StatusTime st{2.0, 0.0};
        ASSERT_TRUE(bTrackRegionOptimise(s.track, s.region, &st, 0.25, 1, plano_host_interface(host)));
        EXPECT_EQ(s.region->status, shift == 0 ? TRACK_REGION_OK : TRACK_REGION_OUT_OF_VIEW);
        EXPECT_NEAR(st.done, 0.25, 1e-12);
        vThreadedWorkerPoolFree();
        plano_host_free(host);
    }
    EXPECT_TRUE(fails_with(bTrackRegionOptimise(nullptr, nullptr, nullptr, 0, 0, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
}

}  // namespace
