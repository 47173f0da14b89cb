/* Basic types shared by every part of the numerical and image layer. */
#ifndef PELLUX_BASE_H
#define PELLUX_BASE_H

#include <stddef.h>
#include <stdint.h>

#if defined(PLX_BUILDING_LIBRARY)
#define PLX_API __attribute__((visibility("default")))
#else
#define PLX_API
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* Result of every b... and gb... function: 1 success or true, 0 failure or false. */
typedef int32_t Plx_Bool;
#define PLX_TRUE 1
#define PLX_FALSE 0

/* A rectangle of pixels: column x, row y of its top-left pixel, then its size. */
typedef struct Plx_Window {
    int32_t x, y;
    int32_t width, height;
} Plx_Window;

/* Intersection of two windows; an empty result has zero width and height. */
PLX_API Plx_Window plx_window_intersect(Plx_Window a, Plx_Window b);

#ifdef __cplusplus
}
#endif

#endif
