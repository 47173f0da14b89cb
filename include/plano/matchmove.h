/* Four-corner match-move scripts for the Shake compositor.
 *
 * A tracked planar surface travels to a compositor as a "MatchMove" node whose four corner
 * curves are the only data; the rest of the node is fixed text. Keys hold image coordinates
 * with the origin at the top (y down); the script's origin is at the bottom, so y is written
 * as height - y and turned back on reading. */
#ifndef PLANO_MATCHMOVE_H
#define PLANO_MATCHMOVE_H

#include "pellux/list.h"
#include "plano/plano_base.h"

#ifdef __cplusplus
extern "C" {
#endif

/* One key: a frame number and the four corners, x then y each, corner 1 to corner 4. */
typedef struct MatchMoveKey {
    uint32_t frame;
    double corners[4][2];
} MatchMoveKey;

/* Writes the script of a list of MatchMoveKey in strictly ascending frame order (at least one
 * key, frames up to 2^31 - 1, finite corners), positions and dimensions multiplied by scale.
 * The node name must be a non-empty word without white space, so that the script reads back.
 * Bad arguments: code 32 (an empty list 24, frames out of order 7); nothing is written then.
 * The file cannot be opened: code 25; a failed write: code 36. An existing regular file is
 * replaced only once the new script is complete, so a failed write leaves it as it was; a
 * device or pipe is written in place; a path the call did not create is never removed. */
PLANO_API Plx_Bool bWriteShakeMatchMoveFile(const char *path, int32_t height, int32_t width,
                                            const char *node_name, const Plx_List *keys,
                                            double scale);

/* Reads a script into *keys, a new list of heap MatchMoveKey records (release it with
 * plx_list_free(list, free)). The frames are renumbered so that the first key lands on the
 * first file number of the header. height and width are used when the script has no
 * dimensions line (both must then be at least 1: code 7) and receive the script's dimensions
 * when it has one. The node name is copied into node_name (node_name_size bytes with its
 * terminating zero; a longer name: code 7); node_name may be null. Code 25 when the file
 * cannot be opened, 26 when it is malformed. Outputs are written only on success. */
PLANO_API Plx_Bool bReadShakeMatchMoveFile(const char *path, int32_t *height, int32_t *width,
                                           char *node_name, size_t node_name_size,
                                           Plx_List **keys);

#ifdef __cplusplus
}
#endif

#endif
