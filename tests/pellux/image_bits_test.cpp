// Bit images against plain per-pixel references, on widths that end mid-word and on views
// whose last word also holds parent pixels.
#include <algorithm>
#include "image_test_util.hpp"

using namespace plx_test;

namespace {

const struct {
    const char *name;
    std::function<Plx_Bool(const Plx_Image *, const Plx_Image *, Plx_Image *)> op;
    std::function<int(int, int)> ref;
} kLogic[] = {
    {"and", plx_image_bit_and_q, [](int a, int b) { return a & b; }},
    {"or", plx_image_bit_or_q, [](int a, int b) { return a | b; }},
    {"eor", plx_image_bit_eor_q, [](int a, int b) { return a ^ b; }},
    {"nand", plx_image_bit_nand_q, [](int a, int b) { return 1 - (a & b); }},
    {"andnot", plx_image_bit_andnot_q, [](int a, int b) { return a & (1 - b); }},
    {"invert", [](const Plx_Image *a, const Plx_Image *, Plx_Image *d) { return plx_image_bit_invert_q(a, d); },
     [](int a, int) { return 1 - a; }},
};

std::vector<uint8_t> dilate_ref(const std::vector<uint8_t> &in, int h, int w, int radius, bool along_x)
{
    std::vector<uint8_t> out(in.size(), 0);
    for (int r = 0; r < h; ++r)
        for (int c = 0; c < w; ++c)
            for (int k = -radius; k <= radius; ++k) {
                int rr = along_x ? r : r + k, cc = along_x ? c + k : c;
                if (rr >= 0 && rr < h && cc >= 0 && cc < w && in[size_t(rr) * w + cc]) out[size_t(r) * w + c] = 1;
            }
    return out;
}

}  // namespace

TEST(ImageBits, LogicMatchesPerPixelReference)
{
    for (int32_t w : {1, 32, 33, 65}) {
        ImagePtr a = random_bits(5, w, 0.5, 1 + w), b = random_bits(5, w, 0.5, 100 + w);
        const std::vector<uint8_t> pa = bits_of(a.get()), pb = bits_of(b.get());
        for (const auto &lc : kLogic) {
            Plx_Image d{};
            ASSERT_TRUE(lc.op(a.get(), b.get(), &d));  // a zeroed record is formed
            std::vector<uint8_t> got = bits_of(&d);
            for (size_t i = 0; i < got.size(); ++i) ASSERT_EQ(got[i], lc.ref(pa[i], pb[i])) << lc.name << " " << w;
            for (int32_t r = 0; r < 5; ++r) EXPECT_EQ(padding(&d, r), 0u) << lc.name;
            plx_image_free(&d);
            ImagePtr a2(plx_image_copy_q(a.get(), nullptr));  // in place into an operand
            ASSERT_TRUE(lc.op(a2.get(), b.get(), a2.get()));
            EXPECT_EQ(bits_of(a2.get()), got);
        }
    }
}

TEST(ImageBits, ViewsChangeOnlyTheirOwnPixels)
{
    // 33 columns from column 32 of 100: the view's second word also holds parent columns 65..95.
    ImagePtr pa = random_bits(7, 100, 0.5, 5), pb = random_bits(7, 100, 0.5, 6), pd = random_bits(7, 100, 0.5, 7);
    const Plx_Window win{32, 2, 33, 4};
    Plx_Image a{}, b{}, d{};
    plx_image_extract_q(pa.get(), win, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &a);
    plx_image_extract_q(pb.get(), win, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &b);
    ASSERT_NE(plx_image_extract_q(pd.get(), win, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &d), nullptr);
    const std::vector<uint8_t> before = bits_of(pd.get()), va = bits_of(&a), vb = bits_of(&b);
    auto expect_outside_unchanged = [&](const char *what) {
        std::vector<uint8_t> now = bits_of(pd.get());
        for (int r = 0; r < 7; ++r)
            for (int c = 0; c < 100; ++c) {
                bool in = r >= win.y && r < win.y + win.height && c >= win.x && c < win.x + win.width;
                ASSERT_TRUE(in || now[r * 100 + c] == before[r * 100 + c]) << what << " " << r << "," << c;
            }
    };
    for (const auto &lc : kLogic) {
        ASSERT_TRUE(lc.op(&a, &b, &d));
        std::vector<uint8_t> got = bits_of(&d);
        for (size_t i = 0; i < got.size(); ++i) ASSERT_EQ(got[i], lc.ref(va[i], vb[i])) << lc.name;
        expect_outside_unchanged(lc.name);
    }
    for (bool along_x : {true, false}) {
        ASSERT_TRUE((along_x ? plx_image_bit_dilate_x_q : plx_image_bit_dilate_y_q)(&a, 3, &d));
        EXPECT_EQ(bits_of(&d), dilate_ref(va, 4, 33, 3, along_x));
        expect_outside_unchanged("dilate");
    }
    // Parent pixels past the view count for neither its total nor its box.
    EXPECT_EQ(plx_image_bit_count(&a), uint32_t(std::count(va.begin(), va.end(), 1)));
    Plx_Window box;
    ASSERT_TRUE(plx_image_get_active_subwindow_b(&a, &box));
    EXPECT_LE(box.x + box.width, 33);
    plx_image_free(&a);
    plx_image_free(&b);
    plx_image_free(&d);
}

TEST(ImageBits, DilationMatchesBruteForce)
{
    for (int32_t w : {1, 31, 33, 70}) {
        ImagePtr a = random_bits(37, w, 0.04, 40 + w);
        const std::vector<uint8_t> pa = bits_of(a.get());
        for (uint32_t radius : {0u, 1u, 2u, 5u, 31u, 32u, 33u, 1000u}) {
            Plx_Image dx{}, dy{};
            ASSERT_TRUE(plx_image_bit_dilate_x_q(a.get(), radius, &dx));
            ASSERT_TRUE(plx_image_bit_dilate_y_q(a.get(), radius, &dy));
            EXPECT_EQ(bits_of(&dx), dilate_ref(pa, 37, w, int(radius), true)) << w << " " << radius;
            EXPECT_EQ(bits_of(&dy), dilate_ref(pa, 37, w, int(radius), false)) << w << " " << radius;
            for (int32_t r = 0; r < 37; ++r) ASSERT_EQ(padding(&dx, r) | padding(&dy, r), 0u);
            plx_image_free(&dx);
            plx_image_free(&dy);
        }
    }
    // In place, x then y: one pixel becomes a 5 x 5 square, found by count and box.
    ImagePtr one = make(PLX_FORMAT_GREY, PLX_TYPE_BIT, 9, 40);
    Plx_Window box{9, 9, 9, 9};
    ASSERT_TRUE(plx_image_get_active_subwindow_b(one.get(), &box));  // formed cleared: empty box
    EXPECT_EQ(as_vec(box), std::vector<int>({0, 0, 0, 0}));
    plx_image_set_bit(one.get(), 4, 33, 1);
    ASSERT_TRUE(plx_image_bit_dilate_x_q(one.get(), 2, one.get()));
    ASSERT_TRUE(plx_image_bit_dilate_y_q(one.get(), 2, one.get()));
    EXPECT_EQ(plx_image_bit_count(one.get()), 25u);
    ASSERT_TRUE(plx_image_get_active_subwindow(one.get(), &box));
    EXPECT_EQ(as_vec(box), std::vector<int>({31, 2, 5, 5}));
}

TEST(ImageBits, BadOperandsFailWithTheirCodesAndTouchNothing)
{
    ImagePtr a = random_bits(4, 33, 0.5, 1), b = random_bits(4, 34, 0.5, 2), d = random_bits(4, 33, 0.5, 3);
    ImagePtr grey = make(PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 4, 33), parent = random_bits(4, 64, 0.5, 9);
    Plx_Image v{};  // a view of another shape
    ASSERT_NE(plx_image_extract_q(parent.get(), Plx_Window{32, 0, 20, 4}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &v), nullptr);
    const std::vector<uint8_t> d_before = raw_bytes(d.get()), p_before = raw_bytes(parent.get());
    Plx_Window w;
    expect_failures({
        {[&] { return plx_image_bit_and_q(a.get(), b.get(), d.get()); }, PLX_ERROR_INCOMPATIBLE},
        {[&] { return plx_image_bit_or_q(a.get(), grey.get(), d.get()); }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_bit_dilate_x_q(grey.get(), 1, d.get()); }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_bit_eor_q(nullptr, a.get(), d.get()); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_bit_dilate_y_q(a.get(), 2, nullptr); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_bit_invert_q(a.get(), &v); }, PLX_ERROR_INCOMPATIBLE},
        {[&] { return plx_image_get_active_subwindow_b(grey.get(), &w); }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
        {[&] { return plx_image_get_active_subwindow_b(a.get(), nullptr); }, PLX_ERROR_ILLEGAL_ARGUMENT},
        {[&] { return plx_image_bit_count(grey.get()) != 0; }, PLX_ERROR_ILLEGAL_PIXEL_TYPE},
    });
    EXPECT_EQ(raw_bytes(d.get()), d_before);
    EXPECT_EQ(raw_bytes(parent.get()), p_before);
    plx_image_free(&v);
}
