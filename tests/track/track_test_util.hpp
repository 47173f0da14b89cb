// Helpers shared by the tracking tests: owned images filled from a function, bit masks and
// rectangles, pixel reads, the code at the origin of the error trace, and a fixture with a host.
#ifndef PLANO_TESTS_TRACK_TRACK_TEST_UTIL_HPP
#define PLANO_TESTS_TRACK_TRACK_TEST_UTIL_HPP

#include <functional>
#include <memory>
#include <vector>

#include <gtest/gtest.h>

#include "failure_check.hpp"

#include "pellux/pellux.h"
#include "plano/threads.h"
#include "plano_host/host.h"

namespace track_test {

using plano_test::fails_with;

struct ImageFree {
    void operator()(Plx_Image *im) const { plx_image_free(im); }
};
using Image = std::unique_ptr<Plx_Image, ImageFree>;

inline Image make(Plx_ImageFormat format, Plx_PixelType type, int32_t h, int32_t w,
           const std::function<double(int32_t, int32_t, int)> &value)
{
    Image im(plx_image_form_gen(nullptr, format, type, h, w));
    const int channels = int(plx_image_format_channels(format));
    std::vector<double> v(static_cast<size_t>(channels), 0.0);
    for (int32_t r = 0; r < h; ++r)
        for (int32_t c = 0; c < w; ++c) {
            for (int k = 0; k < channels; ++k) v[size_t(k)] = value(r, c, k);
            plx_image_set_pixel(im.get(), r, c, v.data());
        }
    return im;
}

inline Image mask_of(int32_t h, int32_t w, const std::function<bool(int32_t, int32_t)> &set)
{
    return make(PLX_FORMAT_GREY, PLX_TYPE_BIT, h, w, [&](int32_t r, int32_t c, int) { return set(r, c) ? 1.0 : 0.0; });
}

// Bit image of size h x w with the rectangle [x, x + rw) x [y, y + rh) set.
inline Image rect_mask(int32_t h, int32_t w, int32_t x, int32_t y, int32_t rw, int32_t rh)
{
    return mask_of(h, w, [=](int32_t r, int32_t c) { return c >= x && c < x + rw && r >= y && r < y + rh; });
}

inline double px(const Plx_Image *im, int32_t r, int32_t c, int k = 0)
{
    double v[4] = {0, 0, 0, 0};
    plx_image_get_pixel(im, r, c, v);
    return v[k];
}

inline int32_t origin_code()
{
    Plx_ErrorRecord r{};
    plx_err_get_error(0, &r);
    return r.code;
}


// A fixture with a three-job host and a fresh worker pool around every test.
class HostTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        vThreadedWorkerPoolFree();
        host_ = plano_host_new(3);
    }
    void TearDown() override
    {
        vThreadedWorkerPoolFree();
        plano_host_free(host_);
    }
    const ThreadHostInterface *table() const { return plano_host_interface(host_); }
    PlanoHost *host_ = nullptr;
};

}  // namespace track_test

#endif
