// Copying windows between images, with format and type conversion.
#include <cstring>

#include "image_internal.hpp"
#include "pellux/error.h"

namespace plx {

bool copy_window_converted(const Plx_Image *source, Plx_Window window, Plx_Image *dest)
{
    if (source->format == dest->format && source->type == dest->type &&
        source->type != PLX_TYPE_BIT) {
        std::size_t px = static_cast<std::size_t>(plx_image_format_channels(source->format)) *
                         plx_image_type_size(source->type);
        for (int32_t r = 0; r < window.height; ++r)
            std::memcpy(plx_image_row(dest, r),
                        static_cast<const char *>(plx_image_row(source, window.y + r)) + window.x * px,
                        static_cast<std::size_t>(window.width) * px);
        return true;
    }
    PLX_ERR_START(PLX_ERROR_UNSUPPORTED, "conversion not available yet", 0);
    return false;
}

}  // namespace plx
