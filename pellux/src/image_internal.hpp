// Internal image helpers shared by the image source files.
#ifndef PELLUX_SRC_IMAGE_INTERNAL_HPP
#define PELLUX_SRC_IMAGE_INTERNAL_HPP

#include "pellux/image.h"

namespace plx {

// True for a format/type pair an image may have.
bool valid_format_type(Plx_ImageFormat format, Plx_PixelType type);
// Registers code 39/38 (under function) and returns false when the pair is not valid.
bool check_format_type(Plx_ImageFormat format, Plx_PixelType type, const char *function);
// True when window lies inside image.
bool window_inside(const Plx_Image *image, Plx_Window window);
// Copies the window of source into dest (already formed with the window's size), converting
// format and type. Registers its own failure.
bool copy_window_converted(const Plx_Image *source, Plx_Window window, Plx_Image *dest);

}  // namespace plx

#endif
