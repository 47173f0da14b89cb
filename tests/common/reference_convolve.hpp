// Plain reference convolution for the tests: one value at a time, in double, with the edge
// rules written out as a walk rather than a formula.
#ifndef PLANO_TESTS_REFERENCE_CONVOLVE_HPP
#define PLANO_TESTS_REFERENCE_CONVOLVE_HPP

#include <cmath>
#include <cstdint>
#include <limits>
#include <random>
#include <type_traits>
#include <vector>

#include "pellux/pellux.h"

namespace reference {

template <class T>
T *at(const Plx_Image *im, int r, int c, int ch)
{
    const int channels = int(plx_image_format_channels(im->format));
    return static_cast<T *>(plx_image_row(im, r)) + c * channels + ch;
}

// Fills every value with noise in a range that suits the type (bounded for the wide integer
// types so sums stay exact in double).
template <class T>
void fill_noise(Plx_Image *im, unsigned seed)
{
    std::mt19937 gen(seed);
    const int channels = int(plx_image_format_channels(im->format));
    for (int r = 0; r < im->height; ++r)
        for (int c = 0; c < im->width; ++c)
            for (int ch = 0; ch < channels; ++ch) {
                double v;
                if constexpr (std::is_floating_point_v<T>)
                    v = std::uniform_real_distribution<double>(-1.0, 2.0)(gen);
                else if constexpr (sizeof(T) <= 2)
                    v = double(std::uniform_int_distribution<int>(0, std::numeric_limits<T>::max())(gen));
                else if constexpr (std::is_signed_v<T>)
                    v = double(std::uniform_int_distribution<int>(-1000000, 1000000)(gen));
                else
                    v = double(std::uniform_int_distribution<uint32_t>(0, 4000000000u)(gen));
                *at<T>(im, r, c, ch) = T(v);
            }
}

// Where position p of a line of n samples reads from, or -1 for zero; reflection walks back
// and forth until it lands inside.
inline int source_index(int p, int n, Plx_EdgeBehaviour edge)
{
    if (p >= 0 && p < n) return p;
    if (edge == PLX_EDGE_ZERO) return -1;
    if (edge == PLX_EDGE_EXTEND) return p < 0 ? 0 : n - 1;
    if (n == 1) return 0;
    while (p < 0 || p >= n) {
        if (p < 0) p = -p;
        if (p >= n) p = 2 * (n - 1) - p;
    }
    return p;
}

// Rounds to nearest (halves away from zero) and clamps into T, as the library does.
template <class T>
T to_type(double v)
{
    if constexpr (std::is_floating_point_v<T>) {
        return T(v);
    } else {
        const double lo = double(std::numeric_limits<T>::lowest()), hi = double(std::numeric_limits<T>::max());
        v = std::round(v);
        return T(v < lo ? lo : v > hi ? hi : v);
    }
}

// The exact convolution of one channel (channel -1: all) into a vector of doubles, row-major
// with all channels; channels not convolved carry dest's values.
template <class T>
std::vector<double> convolve(const Plx_Image *src, const Plx_Image *dest, int channel, Plx_EdgeBehaviour edge,
                             const std::vector<double> &mask, bool along_y)
{
    const int channels = int(plx_image_format_channels(src->format));
    const int r = int(mask.size()) / 2;
    std::vector<double> out;
    for (int y = 0; y < src->height; ++y)
        for (int x = 0; x < src->width; ++x)
            for (int ch = 0; ch < channels; ++ch) {
                if (channel >= 0 && ch != channel) {
                    out.push_back(double(*at<T>(dest, y, x, ch)));
                    continue;
                }
                double sum = 0;
                for (int i = 0; i < int(mask.size()); ++i) {
                    const int m = along_y ? source_index(y + i - r, src->height, edge)
                                          : source_index(x + i - r, src->width, edge);
                    if (m < 0) continue;
                    sum += mask[i] * double(along_y ? *at<T>(src, m, x, ch) : *at<T>(src, y, m, ch));
                }
                out.push_back(sum);
            }
    return out;
}

// Gaussian taps exp(-i^2 / (2 sigma^2)) for |i| <= trunc(4 sigma), summing to 1.
inline std::vector<double> gaussian(double sigma)
{
    const int r = int(std::trunc(4 * sigma));
    std::vector<double> k;
    double sum = 0;
    for (int i = -r; i <= r; ++i) {
        k.push_back(std::exp(-double(i * i) / (2 * sigma * sigma)));
        sum += k.back();
    }
    for (double &v : k) v /= sum;
    return k;
}

}  // namespace reference

#endif
