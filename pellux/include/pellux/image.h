/* Images.
 *
 * An image is a plain record: format (channel layout), pixel type, size, row stride in bytes,
 * and the offset (x, y) of its pixel (0, 0) within a larger frame. Rows need not be adjacent:
 * a view of part of another image shares its pixels and only changes data, size and offset.
 *
 * Bit images (type PLX_TYPE_BIT, grey format) store each row as 32-bit words; pixel c of a row
 * is bit (c mod 32) of word c / 32. The bits past the width in the last word start zero in an
 * image that owns its pixels and no operation changes them (in a view they are the parent's
 * pixels); no operation reads them as pixels.
 *
 * Pixel values: unsigned char and unsigned short are normalised (255 and 65535 stand for 1.0),
 * float and double hold the value itself (1.0 is full scale), bits are 0 or 1 (1 is full scale);
 * int and unsigned int are plain numbers. Type conversion rescales between the normalised and
 * floating types (rounding to nearest, halves away from zero, and clamping into integer ranges)
 * and converts int and unsigned int by value; a bit is set from half of full scale upwards.
 * Format conversion: colour to grey through plx_rgb_to_luminance, grey to colour by
 * repetition, alpha dropped or, where the source has none, full scale; BGR order is honoured.
 * Vector fields convert only to vector fields (a missing z is 0) and pointers only to
 * pointers: codes 39 and 38 otherwise.
 *
 * Destinations: a null dest makes a new heap record; a zeroed record or an image is (re)formed
 * to the result's format, type and size, unless it has them already (then its pixels, and its
 * place in a larger image when it is a view, are written in place); a view of another shape
 * fails with code 7. Failing calls leave dest unchanged, except where noted.
 *
 * Windows (Plx_Window) given to image operations are in the image's own pixel coordinates;
 * the frame offset is never subtracted unless a function says so. A window must lie inside
 * the image (code 32). */
#ifndef PELLUX_IMAGE_H
#define PELLUX_IMAGE_H

#include "pellux/base.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef enum Plx_ImageFormat {
    PLX_FORMAT_NONE = 0,
    PLX_FORMAT_GREY = 1,       /* grey level, 1 channel */
    PLX_FORMAT_GREY_ALPHA = 2, /* grey level with alpha, 2 channels */
    PLX_FORMAT_RGB = 3,        /* red, green, blue */
    PLX_FORMAT_RGBA = 4,       /* red, green, blue, alpha */
    PLX_FORMAT_BGR = 5,        /* blue-first RGB */
    PLX_FORMAT_BGRA = 6,       /* blue-first RGB with alpha */
    PLX_FORMAT_VECTOR2D = 7,   /* 2D vector field (x, y) */
    PLX_FORMAT_VECTOR3D = 8,   /* 3D vector field (x, y, z) */
    PLX_FORMAT_POINTER = 9     /* one pointer per pixel (type PLX_TYPE_POINTER) */
} Plx_ImageFormat;

typedef enum Plx_PixelType {
    PLX_TYPE_NONE = 0,
    PLX_TYPE_BIT = 1,
    PLX_TYPE_UCHAR = 2,
    PLX_TYPE_USHORT = 3,
    PLX_TYPE_INT = 4,
    PLX_TYPE_UINT = 5,
    PLX_TYPE_FLOAT = 6,
    PLX_TYPE_DOUBLE = 7,
    PLX_TYPE_POINTER = 8
} Plx_PixelType;

/* Edge behaviour of the 1D convolutions: what lies outside the image. */
typedef enum Plx_EdgeBehaviour {
    PLX_EDGE_ZERO = 0,     /* zero */
    PLX_EDGE_EXTEND = 1,   /* the nearest edge pixel repeated */
    PLX_EDGE_REFLECT = 2   /* mirrored about the edge pixel: ... 2 1 | 0 1 2 ... */
} Plx_EdgeBehaviour;

typedef struct Plx_Image Plx_Image;

struct Plx_Image {
    Plx_ImageFormat format;
    Plx_PixelType type;
    int32_t height, width;
    int32_t stride;       /* bytes from the start of one row to the next */
    int32_t x, y;         /* offset of pixel (0, 0) within the larger frame */
    void *data;           /* first byte of row 0 (null for an empty image) */
    void *block;          /* pixel memory this record owns, or null (a view, or empty) */
    size_t block_size;    /* bytes of block */
    uint32_t owned;       /* 1: the record itself came from the heap and free releases it */
    void (*free_func)(Plx_Image *image); /* releases what the record owns */
};

/* Channels of a format (0 for PLX_FORMAT_NONE) and bytes of one value of a type (bit: 0). */
PLX_API uint32_t plx_image_format_channels(Plx_ImageFormat format);
PLX_API uint32_t plx_image_type_size(Plx_PixelType type);
/* The smallest row stride in bytes for a format, type and width (bit rows round up to words). */
PLX_API int32_t plx_image_min_stride(Plx_ImageFormat format, Plx_PixelType type, int32_t width);

/* Address of row r (no checks). */
static inline void *plx_image_row(const Plx_Image *image, int32_t r)
{
    return (char *)image->data + (ptrdiff_t)r * image->stride;
}

/* Forms an image with the smallest stride and uninitialised pixels. image null: a new heap
 * record (owned). Sizes may be zero; negative sizes fail with code 32, an unknown or
 * impossible format/type pair with codes 39/38, allocation with code 5. */
PLX_API Plx_Image *plx_image_form_gen(Plx_Image *image, Plx_ImageFormat format,
                                      Plx_PixelType type, int32_t height, int32_t width);
/* Gives an existing image (formed, or a zeroed record) a new format, type and size with the
 * smallest stride, reusing its pixel block when large enough. A view cannot be re-set to a
 * different size, format or type: code 7. */
PLX_API Plx_Bool plx_image_set_gen(Plx_Image *image, Plx_ImageFormat format, Plx_PixelType type,
                                   int32_t height, int32_t width);
/* Releases what the image owns, and the record when owned. Null is ignored. */
PLX_API void plx_image_free(Plx_Image *image);
/* A new image of the same format, type and size with the pixels copied; dest null allocates. */
PLX_API Plx_Image *plx_image_copy_q(const Plx_Image *source, Plx_Image *dest);

/* Shorthands of plx_image_form_gen: _gl grey, _gla grey-alpha, _rgb, _rgba, _bgr, _bgra,
 * _v2 / _v3 vector fields; _uc _us _i _ui _f _d pixel types; _b a grey bit image. */
#define PLX_IMAGE_FORM_SHORTHAND(fmt, ty)                                                      \
    PLX_API Plx_Image *plx_image_form_gen_##fmt##_##ty(Plx_Image *image, int32_t height,        \
                                                       int32_t width);
#define PLX_IMAGE_FORM_SHORTHANDS(fmt)                                                         \
    PLX_IMAGE_FORM_SHORTHAND(fmt, uc) PLX_IMAGE_FORM_SHORTHAND(fmt, us)                        \
    PLX_IMAGE_FORM_SHORTHAND(fmt, i) PLX_IMAGE_FORM_SHORTHAND(fmt, ui)                         \
    PLX_IMAGE_FORM_SHORTHAND(fmt, f) PLX_IMAGE_FORM_SHORTHAND(fmt, d)
PLX_IMAGE_FORM_SHORTHANDS(gl)
PLX_IMAGE_FORM_SHORTHANDS(gla)
PLX_IMAGE_FORM_SHORTHANDS(rgb)
PLX_IMAGE_FORM_SHORTHANDS(rgba)
PLX_IMAGE_FORM_SHORTHANDS(bgr)
PLX_IMAGE_FORM_SHORTHANDS(bgra)
PLX_IMAGE_FORM_SHORTHANDS(v2)
PLX_IMAGE_FORM_SHORTHANDS(v3)
#undef PLX_IMAGE_FORM_SHORTHANDS
#undef PLX_IMAGE_FORM_SHORTHAND
PLX_API Plx_Image *plx_image_form_gen_b(Plx_Image *image, int32_t height, int32_t width);
PLX_API Plx_Image *plx_image_form_gen_p(Plx_Image *image, int32_t height, int32_t width);

/* ---- single pixels ----
 * Values are the stored numbers as doubles (255.0 for a full unsigned char), one per channel
 * in the format's order (BGR: blue first); bits are 0 or 1. Setting rounds to nearest and
 * clamps to the type (a bit is set from 0.5). Coordinates outside the image fail with code
 * 32, pointer images with code 38. */
PLX_API Plx_Bool plx_image_get_pixel(const Plx_Image *image, int32_t row, int32_t col,
                                     double *values);
PLX_API Plx_Bool plx_image_set_pixel(Plx_Image *image, int32_t row, int32_t col,
                                     const double *values);
/* Reads a pixel of source and stores it into dest converted to dest's format and type
 * (colour to grey through plx_rgb_to_luminance, grey to colour by repetition, alpha 1.0 when
 * the source has none). */
PLX_API Plx_Bool plx_image_convert_pixel(const Plx_Image *source, int32_t srow, int32_t scol,
                                         Plx_Image *dest, int32_t drow, int32_t dcol);
/* Bit and pointer accessors: a bad image or position registers code 32/38 and reads 0/null
 * or writes nothing. */
PLX_API Plx_Bool plx_image_get_bit(const Plx_Image *image, int32_t row, int32_t col);
PLX_API void plx_image_set_bit(Plx_Image *image, int32_t row, int32_t col, Plx_Bool value);
PLX_API void *plx_image_get_pointer(const Plx_Image *image, int32_t row, int32_t col);
PLX_API void plx_image_set_pointer(Plx_Image *image, int32_t row, int32_t col, void *value);

/* ---- fill ---- */
/* Zero fill works on every type (pointer images get null pointers). */
PLX_API Plx_Bool plx_image_fill_zero(Plx_Image *image);
PLX_API Plx_Bool plx_image_fill_zero_window(Plx_Image *image, Plx_Window window);
/* values: one double per channel, stored as plx_image_set_pixel stores them (pointer images:
 * code 38). */
PLX_API Plx_Bool plx_image_fill_const(Plx_Image *image, const double *values);
PLX_API Plx_Bool plx_image_fill_const_window(Plx_Image *image, Plx_Window window,
                                             const double *values);

/* ---- extraction ----
 * plx_image_extract_q: dest becomes the window of source. copy 0: a view sharing source's
 * pixels (format and type must be PLX_FORMAT_NONE/PLX_TYPE_NONE or source's own; a bit view
 * needs a window x that is a multiple of 32). copy 1: dest is (re)formed with the window's size
 * and the given format and type (NONE = source's) and the pixels are copied and converted (a
 * view given as dest is dropped, not written through). Either way dest's old pixels are
 * released, so they must not hold source's (code 7). The result's frame offset is source's
 * offset plus the window origin. A window not inside the image fails with code 32. Returns
 * dest, or a new record when dest is null. */
PLX_API Plx_Image *plx_image_extract_q(const Plx_Image *source, Plx_Window window,
                                       Plx_ImageFormat format, Plx_PixelType type,
                                       Plx_Bool copy, Plx_Image *dest);
/* One channel of source (index in the format's order, as plx_image_get_pixel gives them;
 * code 32 past the last) as a grey image of the given type (NONE = source's), copied; dest
 * takes source's frame offset. */
PLX_API Plx_Image *plx_image_extract_channel_q(const Plx_Image *source, uint32_t channel,
                                               Plx_PixelType type, Plx_Image *dest);
/* The whole image converted to another format and type (NONE = source's), dest formed to
 * source's size and given its frame offset. dest may not be source (code 32). */
PLX_API Plx_Image *plx_image_convert_q(const Plx_Image *source, Plx_ImageFormat format,
                                       Plx_PixelType type, Plx_Image *dest);

/* ---- active subwindows ----
 * The active subwindow of a bit image is the bounding box of its set pixels ({0, 0, 0, 0}
 * when none is set); of another image, the bounding box of its pixels with any nonzero channel
 * (non-null, for pointers). plx_image_get_active_subwindow_b takes only bit images (code 38). */
PLX_API Plx_Bool plx_image_get_active_subwindow_b(const Plx_Image *image, Plx_Window *window);
PLX_API Plx_Bool plx_image_get_active_subwindow(const Plx_Image *image, Plx_Window *window);

/* ---- bit-image logic ----
 * All operands are bit images (code 38) of equal size (code 7); dest (not null) may be either
 * operand itself, but not a differently placed view of one. Dilation grows set pixels by
 * radius pixels along rows (_x) or columns (_y), so the two in turn give a square
 * neighbourhood; radius 0 copies. */
PLX_API Plx_Bool plx_image_bit_and_q(const Plx_Image *a, const Plx_Image *b, Plx_Image *dest);
PLX_API Plx_Bool plx_image_bit_or_q(const Plx_Image *a, const Plx_Image *b, Plx_Image *dest);
PLX_API Plx_Bool plx_image_bit_eor_q(const Plx_Image *a, const Plx_Image *b, Plx_Image *dest);
PLX_API Plx_Bool plx_image_bit_nand_q(const Plx_Image *a, const Plx_Image *b, Plx_Image *dest);
/* a and not b */
PLX_API Plx_Bool plx_image_bit_andnot_q(const Plx_Image *a, const Plx_Image *b, Plx_Image *dest);
PLX_API Plx_Bool plx_image_bit_invert_q(const Plx_Image *a, Plx_Image *dest);
PLX_API Plx_Bool plx_image_bit_dilate_x_q(const Plx_Image *a, uint32_t radius, Plx_Image *dest);
PLX_API Plx_Bool plx_image_bit_dilate_y_q(const Plx_Image *a, uint32_t radius, Plx_Image *dest);
/* Number of set pixels (0 with a trace record when image is not a bit image). */
PLX_API uint32_t plx_image_bit_count(const Plx_Image *image);

/* ---- halving ----
 * dest gets floor(height/2) x floor(width/2) pixels, each the mean of its 2x2 source block
 * (integers rounded to nearest, halves upwards; vector fields averaged as they are; bits: set
 * when all four are set); an odd last row or column is dropped. dest has source's format and
 * type and the frame offset floor(offset / 2). Pointer images: code 38; dest == source: 32. */
PLX_API Plx_Image *plx_image_halve_size(const Plx_Image *source, Plx_Image *dest);

/* ---- 1D convolution ----
 * A mask of odd size 2r+1, centred on its middle tap; float or double values. */
typedef struct Plx_Mask1D {
    Plx_PixelType type;  /* PLX_TYPE_FLOAT or PLX_TYPE_DOUBLE */
    uint32_t size;
    void *data;
} Plx_Mask1D;

/* Gaussian mask exp(-i^2 / (2 sigma^2)) for i = -r..r, size = 2r+1, normalised to sum to
 * scale. sigma must be positive and size odd: code 32. */
PLX_API Plx_Mask1D *plx_gauss_mask_new(Plx_PixelType type, double sigma, uint32_t size,
                                       double scale);
PLX_API void plx_mask1D_free(Plx_Mask1D *mask);

/* dest(r, c) = sum_i mask[i] * source(r, c + i - r0) along x (1Dx) or rows along y (1Dy).
 * source and dest have equal format, type and size, and must not share pixels. channel < 0
 * convolves every channel, else only that one. Integer types round to nearest and clamp. */
PLX_API Plx_Bool plx_image_convolve1Dx_q(const Plx_Image *source, int32_t channel,
                                         Plx_EdgeBehaviour edge, const Plx_Mask1D *mask,
                                         Plx_Image *dest);
PLX_API Plx_Bool plx_image_convolve1Dy_q(const Plx_Image *source, int32_t channel,
                                         Plx_EdgeBehaviour edge, const Plx_Mask1D *mask,
                                         Plx_Image *dest);

/* ---- pyramids ----
 * Level 0 holds the caller's image and mask (borrowed, never freed by the pyramid); level l+1
 * is level l halved (plx_image_halve_size), its mask bit set when all four finer bits are set.
 * Images of levels >= 1 are owned by the pyramid. Start from a zeroed record. */
typedef struct Plx_PyramidLevel {
    Plx_Image *image;
    Plx_Image *mask;  /* bit image or null */
} Plx_PyramidLevel;

typedef struct Plx_ImagePyramid {
    uint32_t no_levels;
    Plx_PyramidLevel *level;  /* no_levels entries */
    uint32_t capacity;        /* entries allocated in level */
} Plx_ImagePyramid;

/* Builds no_levels levels into pyramid, reusing its level array and its owned images (their
 * pixel memory, when large enough); storage past no_levels is kept for later builds. mask,
 * when given, is a bit image of image's size (codes 38, 7). no_levels must be at least 1 and
 * leave every level at least 1 x 1 (code 32). image must not be one of the pyramid's own
 * level images. A build that fails part way leaves no_levels at the levels made. */
PLX_API Plx_Bool plx_image_pyramid_build_preallocated(Plx_ImagePyramid *pyramid,
                                                      Plx_Image *image, Plx_Image *mask,
                                                      uint32_t no_levels);
/* Frees the owned levels (1 and up) and the level array; level 0 is left to its owner. */
PLX_API void plx_image_pyramid_free(Plx_ImagePyramid *pyramid);

/* ---- colour ---- */
/* Rec. 709 luminance 0.2126 R + 0.7152 G + 0.0722 B. */
PLX_API double plx_rgb_to_luminance(double r, double g, double b);
/* An RGB, RGBA, BGR or BGRA image (else code 39) to grey (alpha dropped) of the given type
 * (NONE = same), as plx_image_convert_q. */
PLX_API Plx_Image *plx_image_colour_to_grey_q(const Plx_Image *source, Plx_PixelType type,
                                              Plx_Image *dest);
/* 256 floats: lookup_table_8bit[i] = i / 255. */
PLX_API extern const float lookup_table_8bit[256];

#ifdef __cplusplus
}
#endif

#endif
