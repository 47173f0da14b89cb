// The record types of one precision, so code written once over the scalar type can name the
// matching camera, vector and matrix records.
#ifndef PELLUX_DETAIL_PRECISION_HPP
#define PELLUX_DETAIL_PRECISION_HPP

#include "pellux/camera.h"
#include "pellux/fixed.h"

namespace plx {

template <class S>
struct Precision;

template <>
struct Precision<double> {
    using Camera = Plx_Camera;
    using Vec3 = Plx_Vector3;
    using Mat22 = Plx_Matrix22;
    using Mat33 = Plx_Matrix33;
};

template <>
struct Precision<float> {
    using Camera = Plx_Camera_f;
    using Vec3 = Plx_Vector3_f;
    using Mat22 = Plx_Matrix22_f;
    using Mat33 = Plx_Matrix33_f;
};

}  // namespace plx

#endif
