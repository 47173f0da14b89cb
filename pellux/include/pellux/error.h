/* The error trace.
 *
 * A failing function where the failure starts clears the trace and registers one record
 * (function, code, file, line, message, number); each caller that fails because of it
 * registers a record with code 1, so the trace reads from the origin outwards. The trace is
 * kept per thread: failures on worker threads never interleave with the caller's records
 * (the worker pool hands a failed job's records to the thread that waits for it). */
#ifndef PELLUX_ERROR_H
#define PELLUX_ERROR_H

#include <stdio.h>

#include "pellux/base.h"

#ifdef __cplusplus
extern "C" {
#endif

enum {
    PLX_ERROR_CALLEE = 1,              /* a callee failed */
    PLX_ERROR_UNSUPPORTED = 2,         /* an operation a type does not support */
    PLX_ERROR_MALLOC_FAILED = 5,       /* allocation failed; number = bytes */
    PLX_ERROR_INCOMPATIBLE = 7,        /* arguments that do not fit together */
    PLX_ERROR_ILLEGAL_TYPE = 12,       /* a type, model or kind outside the known set */
    PLX_ERROR_DIVISION_BY_ZERO = 18,
    PLX_ERROR_NO_CONVERGENCE = 20,
    PLX_ERROR_SINGULAR_MOTION = 21,
    PLX_ERROR_NO_DATA = 23,
    PLX_ERROR_NOT_ENOUGH_DATA = 24,
    PLX_ERROR_OPENING_FILE = 25,
    PLX_ERROR_CORRUPTED_FILE = 26,
    PLX_ERROR_OUTSIDE_RANGE = 27,
    PLX_ERROR_UNDEFINED_ANGLE = 29,
    PLX_ERROR_NOT_INITIALISED = 31,
    PLX_ERROR_ILLEGAL_ARGUMENT = 32,
    PLX_ERROR_NO_SOLUTION = 34,
    PLX_ERROR_WRITING_FILE = 36,
    PLX_ERROR_THREAD = 37,
    PLX_ERROR_ILLEGAL_PIXEL_TYPE = 38,
    PLX_ERROR_ILLEGAL_FORMAT = 39
};

/* One record of the trace. Texts longer than their field are truncated. */
typedef struct Plx_ErrorRecord {
    char function[64];
    int32_t code;
    char file[128];
    int32_t line;
    char message[256];
    int64_t number;
} Plx_ErrorRecord;

/* Records kept per thread; later registrations beyond this are counted but not stored. */
#define PLX_ERROR_TRACE_CAPACITY 32

PLX_API void plx_err_flush_trace(void);
PLX_API void plx_err_register_fileline(const char *function, int32_t code, const char *file,
                                       int32_t line, const char *message, int64_t number);
/* Number of records registered since the last flush (may exceed the stored capacity). */
PLX_API uint32_t plx_err_get_error_count(void);
/* Record i, 0 being the origin of the failure; 0 when i is not stored. */
PLX_API Plx_Bool plx_err_get_error(uint32_t index, Plx_ErrorRecord *record);
/* Writes the trace, origin first, one line per record. */
PLX_API void plx_err_print_trace(FILE *stream);
/* Writes "function: message (code N)" of the origin record into buffer; returns its length. */
PLX_API size_t plx_err_describe_origin(char *buffer, size_t size);

/* Start a failure here: clear the trace and register one record under the current function. */
#define PLX_ERR_START(code, message, number)                                                   \
    (plx_err_flush_trace(),                                                                    \
     plx_err_register_fileline(__func__, (code), __FILE__, __LINE__, (message), (number)))
/* Same, under an explicit function name (for failures reported on behalf of another entry). */
#define PLX_ERR_START_AS(name, code, message, number)                                          \
    (plx_err_flush_trace(),                                                                    \
     plx_err_register_fileline((name), (code), __FILE__, __LINE__, (message), (number)))
/* A callee failed: add a code-1 record under the current function without clearing. */
#define PLX_ERR_PASS() plx_err_register_fileline(__func__, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0)
#define PLX_ERR_PASS_MSG(message, number)                                                      \
    plx_err_register_fileline(__func__, PLX_ERROR_CALLEE, __FILE__, __LINE__, (message), (number))

#ifdef __cplusplus
}
#endif

#endif
