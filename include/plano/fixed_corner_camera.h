/* Placeholder: declarations arrive with their implementation. */
#ifndef PLANO_FIXED_CORNER_CAMERA_H
#define PLANO_FIXED_CORNER_CAMERA_H
#include "plano/plano_base.h"
#endif
