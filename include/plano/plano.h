/* The Plano engine: one include for the whole C interface. */
#ifndef PLANO_PLANO_H
#define PLANO_PLANO_H

#include "pellux/pellux.h"
#include "plano/plano_base.h"
#include "plano/threads.h"
#include "plano/four_point.h"
#include "plano/fixed_corner_camera.h"
#include "plano/sumo.h"
#include "plano/sumo_states.h"
#include "plano/projective_warp.h"
#include "plano/track.h"
#include "plano/track_pixels.h"
#include "plano/track_correlation.h"
#include "plano/track_homography.h"
#include "plano/matchmove.h"
#include "plano/polygon_fill.h"
#include "plano/xspline.h"
#include "plano/bezier.h"
#include "plano/stabilise.h"

#endif
