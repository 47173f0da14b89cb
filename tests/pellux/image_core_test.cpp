// Forming, viewing and copying images.
#include <gtest/gtest.h>

#include <cstring>

#include "pellux/pellux.h"

TEST(ImageCore, FormsWithSmallestStride)
{
    Plx_Image im;
    ASSERT_NE(plx_image_form_gen_rgb_f(&im, 3, 5), nullptr);
    EXPECT_EQ(im.stride, 5 * 3 * 4);
    EXPECT_EQ(im.owned, 0u);
    plx_image_free(&im);

    Plx_Image *b = plx_image_form_gen_b(nullptr, 2, 33);
    ASSERT_NE(b, nullptr);
    EXPECT_EQ(b->stride, 8);  // 33 bits round up to two words
    EXPECT_EQ(b->owned, 1u);
    plx_image_free(b);
}

TEST(ImageCore, BadFormsFailWithTheirCodes)
{
    Plx_Image im;
    Plx_ErrorRecord rec;
    EXPECT_EQ(plx_image_form_gen(&im, PLX_FORMAT_RGB, PLX_TYPE_BIT, 2, 2), nullptr);
    ASSERT_TRUE(plx_err_get_error(0, &rec));
    EXPECT_EQ(rec.code, PLX_ERROR_ILLEGAL_PIXEL_TYPE);
    EXPECT_EQ(plx_image_form_gen(&im, (Plx_ImageFormat)42, PLX_TYPE_UCHAR, 2, 2), nullptr);
    ASSERT_TRUE(plx_err_get_error(0, &rec));
    EXPECT_EQ(rec.code, PLX_ERROR_ILLEGAL_FORMAT);
    EXPECT_EQ(plx_image_form_gen_gl_uc(&im, -1, 2), nullptr);
    ASSERT_TRUE(plx_err_get_error(0, &rec));
    EXPECT_EQ(rec.code, PLX_ERROR_ILLEGAL_ARGUMENT);
    EXPECT_STREQ(rec.function, "plx_image_form_gen");
}

TEST(ImageCore, ViewSharesPixelsAndCarriesTheFrameOffset)
{
    Plx_Image *im = plx_image_form_gen_gl_uc(nullptr, 4, 6);
    ASSERT_NE(im, nullptr);
    im->x = 100;
    im->y = 200;
    for (int r = 0; r < 4; ++r)
        for (int c = 0; c < 6; ++c) static_cast<uint8_t *>(plx_image_row(im, r))[c] = uint8_t(10 * r + c);
    Plx_Image view;
    std::memset(&view, 0, sizeof view);
    ASSERT_NE(plx_image_extract_q(im, Plx_Window{2, 1, 3, 2}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &view), nullptr);
    EXPECT_EQ(view.x, 102);
    EXPECT_EQ(view.y, 201);
    EXPECT_EQ(static_cast<uint8_t *>(plx_image_row(&view, 1))[2], 24);
    static_cast<uint8_t *>(plx_image_row(&view, 0))[0] = 99;  // writes through to the parent
    EXPECT_EQ(static_cast<uint8_t *>(plx_image_row(im, 1))[2], 99);

    Plx_Image *copy = plx_image_extract_q(im, Plx_Window{2, 1, 3, 2}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 1, nullptr);
    ASSERT_NE(copy, nullptr);
    EXPECT_EQ(static_cast<uint8_t *>(plx_image_row(copy, 1))[2], 24);
    EXPECT_EQ(plx_image_extract_q(im, Plx_Window{4, 0, 3, 1}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &view), nullptr);
    plx_image_free(copy);
    plx_image_free(&view);
    plx_image_free(im);
}

TEST(ErrorTrace, ReadsFromTheOriginOutwards)
{
    PLX_ERR_START(PLX_ERROR_NO_DATA, "first", 7);
    PLX_ERR_PASS();
    ASSERT_EQ(plx_err_get_error_count(), 2u);
    Plx_ErrorRecord r0, r1;
    ASSERT_TRUE(plx_err_get_error(0, &r0));
    ASSERT_TRUE(plx_err_get_error(1, &r1));
    EXPECT_EQ(r0.code, PLX_ERROR_NO_DATA);
    EXPECT_STREQ(r0.message, "first");
    EXPECT_EQ(r0.number, 7);
    EXPECT_EQ(r1.code, PLX_ERROR_CALLEE);
    EXPECT_FALSE(plx_err_get_error(2, &r1));
    plx_err_flush_trace();
    EXPECT_EQ(plx_err_get_error_count(), 0u);
}
