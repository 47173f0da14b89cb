// C++ helpers shared by the implementation of both libraries (never part of the C interface).
#ifndef PELLUX_DETAIL_UTIL_HPP
#define PELLUX_DETAIL_UTIL_HPP

#include <cstdlib>
#include <limits>
#include <memory>

#include "pellux/error.h"

namespace plx {

// Allocates n objects' worth of uninitialised heap memory; on failure clears the trace and
// registers code 5 with the byte count under `function`, and returns null.
template <class T>
T *heap_alloc(std::size_t n, const char *function, const char *file, int line)
{
    if (n == 0) n = 1;
    if (n > std::numeric_limits<std::size_t>::max() / sizeof(T)) {
        plx_err_flush_trace();
        plx_err_register_fileline(function, PLX_ERROR_MALLOC_FAILED, file, line, "size overflow", -1);
        return nullptr;
    }
    void *p = std::malloc(n * sizeof(T));
    if (p == nullptr) {
        plx_err_flush_trace();
        plx_err_register_fileline(function, PLX_ERROR_MALLOC_FAILED, file, line, "",
                                  static_cast<int64_t>(n * sizeof(T)));
    }
    return static_cast<T *>(p);
}

struct FreeDeleter {
    void operator()(void *p) const noexcept { std::free(p); }
};
template <class T>
using HeapPtr = std::unique_ptr<T, FreeDeleter>;

}  // namespace plx

// PLX_ALLOC(T, n): heap_alloc under the current function.
#define PLX_ALLOC(T, n) (::plx::heap_alloc<T>((n), __func__, __FILE__, __LINE__))

#endif
