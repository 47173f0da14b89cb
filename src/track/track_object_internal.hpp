// Helpers shared by the tracker object's source files (track.cpp, track_region.cpp,
// track_homography_calib.cpp, track_driver.cpp).
#ifndef PLANO_SRC_TRACK_TRACK_OBJECT_INTERNAL_HPP
#define PLANO_SRC_TRACK_TRACK_OBJECT_INTERNAL_HPP

#include <cstdint>

#include "plano/track.h"

namespace plano::track {

// Parameters of a motion model (6, 9, 2, 4, 3); 0 for a value outside the known set.
uint32_t model_parameter_count(uint32_t model);

// Releases everything a region owns and the record itself (null is ignored). Caller images,
// buffers and pyramid storage are left alone.
void free_region(TrackRegion *region);

// Moves a region's homography and given information between the calibrated coordinates of
// the cameras and the pixels of its windows (template window to search window), and sets
// in_window_pixels. On failure the trace holds the callee's records (a failure that starts here
// is registered under function) for the caller to add its own; the region is then as it was.
bool region_to_window_pixels(const Track *track, TrackRegion *region, const char *function);
bool region_to_calibrated(const Track *track, TrackRegion *region, const char *function);

// True when region is one of the track's regions.
bool track_has_region(const Track *track, const TrackRegion *region);

}  // namespace plano::track

#endif
