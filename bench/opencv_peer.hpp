// OpenCV as the benchmarks' peer, when it is installed (PLANO_HAVE_OPENCV).
#ifndef PLANO_BENCH_OPENCV_PEER_HPP
#define PLANO_BENCH_OPENCV_PEER_HPP

#ifdef PLANO_HAVE_OPENCV
#pragma GCC diagnostic push
// OpenCV's headers use C11 atomics and mix enumerations, which our warnings reject.
#pragma GCC diagnostic ignored "-Wpedantic"
#pragma GCC diagnostic ignored "-Wdeprecated-enum-enum-conversion"
#include <opencv2/core.hpp>
#include <opencv2/imgproc.hpp>
#include <opencv2/video/tracking.hpp>
#pragma GCC diagnostic pop
#endif

#endif
