// The per-thread error trace.
#include "pellux/error.h"

#include <cstdio>
#include <cstring>

namespace {

struct Trace {
    Plx_ErrorRecord records[PLX_ERROR_TRACE_CAPACITY];
    uint32_t count = 0;  // registered since the last flush; may exceed the capacity
};

// One trace per thread: a job that fails on a worker thread never scrambles the records of
// the thread that started it.
thread_local Trace t_trace;

void copy_text(char *dest, size_t size, const char *text)
{
    if (text == nullptr) text = "";
    std::size_t n = std::strlen(text);
    if (n >= size) n = size - 1;
    std::memcpy(dest, text, n);
    dest[n] = '\0';
}

const char *base_name(const char *path)
{
    if (path == nullptr) return "";
    const char *slash = std::strrchr(path, '/');
    return slash ? slash + 1 : path;
}

}  // namespace

extern "C" {

PLX_API void plx_err_flush_trace(void) { t_trace.count = 0; }

PLX_API void plx_err_register_fileline(const char *function, int32_t code, const char *file,
                                       int32_t line, const char *message, int64_t number)
{
    Trace &t = t_trace;
    if (t.count < PLX_ERROR_TRACE_CAPACITY) {
        Plx_ErrorRecord &r = t.records[t.count];
        copy_text(r.function, sizeof r.function, function);
        r.code = code;
        copy_text(r.file, sizeof r.file, base_name(file));
        r.line = line;
        copy_text(r.message, sizeof r.message, message);
        r.number = number;
    }
    if (t.count < UINT32_MAX) ++t.count;
}

PLX_API uint32_t plx_err_get_error_count(void) { return t_trace.count; }

PLX_API Plx_Bool plx_err_get_error(uint32_t index, Plx_ErrorRecord *record)
{
    const Trace &t = t_trace;
    if (record == nullptr || index >= t.count || index >= PLX_ERROR_TRACE_CAPACITY) return 0;
    *record = t.records[index];
    return 1;
}

PLX_API void plx_err_print_trace(FILE *stream)
{
    if (stream == nullptr) return;
    const Trace &t = t_trace;
    uint32_t stored = t.count < PLX_ERROR_TRACE_CAPACITY ? t.count : PLX_ERROR_TRACE_CAPACITY;
    for (uint32_t i = 0; i < stored; ++i) {
        const Plx_ErrorRecord &r = t.records[i];
        std::fprintf(stream, "%s: code %d at %s:%d", r.function, r.code, r.file, r.line);
        if (r.message[0] != '\0') std::fprintf(stream, ": %s", r.message);
        if (r.number != 0) std::fprintf(stream, " (%lld)", static_cast<long long>(r.number));
        std::fputc('\n', stream);
    }
    if (t.count > stored)
        std::fprintf(stream, "(%u further records not kept)\n", t.count - stored);
}

PLX_API size_t plx_err_describe_origin(char *buffer, size_t size)
{
    if (buffer == nullptr || size == 0) return 0;
    Plx_ErrorRecord r;
    if (!plx_err_get_error(0, &r)) {
        buffer[0] = '\0';
        return 0;
    }
    int n = r.message[0] != '\0'
                ? std::snprintf(buffer, size, "%s: %s (code %d)", r.function, r.message, r.code)
                : std::snprintf(buffer, size, "%s failed (code %d)", r.function, r.code);
    if (n < 0) {
        buffer[0] = '\0';
        return 0;
    }
    return static_cast<std::size_t>(n) < size ? static_cast<std::size_t>(n) : size - 1;
}

}  // extern "C"
