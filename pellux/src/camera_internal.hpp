// Camera records in both precisions, seen through one set of templates.
#ifndef PELLUX_SRC_CAMERA_INTERNAL_HPP
#define PELLUX_SRC_CAMERA_INTERNAL_HPP

#include "pellux/camera.h"
#include "pellux/detail/precision.hpp"

namespace plx {

template <class T> struct CameraTraits;

template <> struct CameraTraits<double> : Precision<double> {
    // Newton steps stop below this, relative to 1 + |x| + |y| in normalised units.
    static constexpr double tolerance = 1e-12;
    static constexpr const char *project_name = "plx_camera_point_project";
    static constexpr const char *backproject_name = "plx_camera_point_backproject";
    static constexpr const char *add_name = "plx_camera_point_add_distortion";
    static constexpr const char *remove_name = "plx_camera_point_remove_distortion";
    static constexpr const char *line_project_name = "plx_camera_line_project";
    static constexpr const char *line_backproject_name = "plx_camera_line_backproject";
};

template <> struct CameraTraits<float> : Precision<float> {
    static constexpr float tolerance = 1e-6f;
    static constexpr const char *project_name = "plx_cameraf_point_project";
    static constexpr const char *backproject_name = "plx_cameraf_point_backproject";
    static constexpr const char *add_name = "plx_cameraf_point_add_distortion";
    static constexpr const char *remove_name = "plx_cameraf_point_remove_distortion";
    static constexpr const char *line_project_name = "plx_cameraf_line_project";
    static constexpr const char *line_backproject_name = "plx_cameraf_line_backproject";
};

// Number of coefficients k[] a type this library handles uses, or -1 for any other type
// (the B-spline types and the engine's own types included).
int camera_coefficient_count(int32_t type);

// Installs the six operations of the record's type; false (and nothing changed) when the
// type is not one this library handles.
template <class T> bool install_camera_operations(typename CameraTraits<T>::Camera *camera);

extern template bool install_camera_operations<double>(Plx_Camera *camera);
extern template bool install_camera_operations<float>(Plx_Camera_f *camera);

}  // namespace plx

#endif
