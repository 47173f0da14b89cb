// The 2-3 chamfer distance map of a mask: how far each set pixel lies inside the mask.
// Two raster passes (forward with the upper and left neighbours, backward with the lower
// and right ones) give the exact 2-3 chamfer distance; outside the image counts as outside
// the mask, so a mask that fills its image still grows inward from the image's edge.
#include <algorithm>

#include "plano/track_correlation.h"
#include "track/track_pixels_internal.hpp"

namespace {

using namespace plano::track;

constexpr uint32_t kUnreached = 65535;
constexpr uint32_t kLargest = 65534;

}  // namespace

extern "C" {

PLANO_API Plx_Bool bImageChamferMap(const Plx_Image *mask, Plx_Image *distance)
{
    if (mask == nullptr || distance == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null mask or distance image", 0);
        return 0;
    }
    if (mask->type != PLX_TYPE_BIT) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "the mask must be a bit image", mask->type);
        return 0;
    }
    if (distance == mask) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the distance image cannot be the mask", 0);
        return 0;
    }
    const int32_t h = mask->height, w = mask->width;
    if (!plx_image_set_gen(distance, PLX_FORMAT_GREY, PLX_TYPE_USHORT, h, w)) {
        PLX_ERR_PASS();
        return 0;
    }
    distance->x = mask->x;
    distance->y = mask->y;
    auto row = [&](int32_t r) { return static_cast<uint16_t *>(plx_image_row(distance, r)); };
    for (int32_t r = 0; r < h; ++r) {
        const uint32_t *bits = bit_row(mask, r);
        uint16_t *d = row(r);
        for (int32_t c = 0; c < w; ++c) d[c] = test_bit(bits, c) ? uint16_t(kUnreached) : uint16_t(0);
    }
    // A neighbour outside the image offers 0 + step.
    for (int32_t r = 0; r < h; ++r) {
        uint16_t *d = row(r);
        const uint16_t *up = r > 0 ? row(r - 1) : nullptr;
        for (int32_t c = 0; c < w; ++c) {
            if (d[c] == 0) continue;
            uint32_t v = d[c];
            v = std::min<uint32_t>(v, (c > 0 ? d[c - 1] : 0u) + 2);
            v = std::min<uint32_t>(v, (up ? up[c] : 0u) + 2);
            v = std::min<uint32_t>(v, (up && c > 0 ? up[c - 1] : 0u) + 3);
            v = std::min<uint32_t>(v, (up && c + 1 < w ? up[c + 1] : 0u) + 3);
            d[c] = uint16_t(std::min(v, kLargest));
        }
    }
    for (int32_t r = h - 1; r >= 0; --r) {
        uint16_t *d = row(r);
        const uint16_t *down = r + 1 < h ? row(r + 1) : nullptr;
        for (int32_t c = w - 1; c >= 0; --c) {
            if (d[c] == 0) continue;
            uint32_t v = d[c];
            v = std::min<uint32_t>(v, (c + 1 < w ? d[c + 1] : 0u) + 2);
            v = std::min<uint32_t>(v, (down ? down[c] : 0u) + 2);
            v = std::min<uint32_t>(v, (down && c + 1 < w ? down[c + 1] : 0u) + 3);
            v = std::min<uint32_t>(v, (down && c > 0 ? down[c - 1] : 0u) + 3);
            d[c] = uint16_t(std::min(v, kLargest));
        }
    }
    return 1;
}

}  // extern "C"
