/* The numerical and image layer: one include for all of it. */
#ifndef PELLUX_PELLUX_H
#define PELLUX_PELLUX_H

#include "pellux/base.h"
#include "pellux/error.h"
#include "pellux/image.h"
#include "pellux/fixed.h"
#include "pellux/matrix.h"
#include "pellux/geometry.h"
#include "pellux/rotation.h"
#include "pellux/numeric.h"
#include "pellux/camera.h"
#include "pellux/list.h"
#include "pellux/memory.h"
#include "pellux/fileio.h"

#endif
