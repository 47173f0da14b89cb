// The process-wide worker pool: workers handed out to jobs and reused once waited for.
//
// Worker records live in blocks of 10; entry 10*j of the address array is the start of
// block j. Each entry has a slot state: idle, busy (from its pool start until its pool wait),
// or vacant (its worker was freed after a failed start and is formed afresh when next used).
// The pool has no lock: it is driven from one controlling thread at a time.
#include <cstdlib>
#include <cstring>

#include "common/internal.hpp"
#include "plano/threads.h"

namespace {

constexpr uint32_t kIdle = 0, kBusy = 1, kVacant = 2;
constexpr uint32_t kBlock = 10;

struct Pool {
    ThreadedWorker **workers = nullptr;
    uint32_t *busy = nullptr;
    uint32_t formed = 0;
    uint32_t capacity = 0;
};

Pool g_pool;

// Adds one block of 10 records; registers code 5 under pThreadedWorkerPoolStart on failure
// and leaves the pool as it was.
bool grow(Pool &pool)
{
    const uint32_t capacity = pool.capacity + kBlock;
    const char *fn = "pThreadedWorkerPoolStart";
    plx::HeapPtr<ThreadedWorker *> workers(plx::heap_alloc<ThreadedWorker *>(capacity, fn, __FILE__, __LINE__));
    if (!workers) return false;
    plx::HeapPtr<uint32_t> busy(plx::heap_alloc<uint32_t>(capacity, fn, __FILE__, __LINE__));
    if (!busy) return false;
    ThreadedWorker *block = plx::heap_alloc<ThreadedWorker>(kBlock, fn, __FILE__, __LINE__);
    if (block == nullptr) return false;
    std::memset(block, 0, sizeof(ThreadedWorker) * kBlock);
    for (uint32_t i = 0; i < pool.capacity; ++i) {
        workers.get()[i] = pool.workers[i];
        busy.get()[i] = pool.busy[i];
    }
    for (uint32_t i = 0; i < kBlock; ++i) {
        workers.get()[pool.capacity + i] = block + i;
        busy.get()[pool.capacity + i] = kIdle;
    }
    std::free(pool.workers);
    std::free(pool.busy);
    pool.workers = workers.release();
    pool.busy = busy.release();
    pool.capacity = capacity;
    return true;
}

// Index of a live pooled worker, or -1.
int64_t find(const Pool &pool, const ThreadedWorker *worker)
{
    if (worker == nullptr) return -1;
    for (uint32_t i = 0; i < pool.formed; ++i)
        if (pool.workers[i] == worker && pool.busy[i] != kVacant) return i;
    return -1;
}

}  // namespace

extern "C" {

PLANO_API ThreadedWorker *pThreadedWorkerPoolStart(ThreadedJobFunction job, void *argument,
                                                   const ThreadHostInterface *host)
{
    if (job == nullptr || host == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, job == nullptr ? "null job function" : "null host table", 0);
        return nullptr;
    }
    Pool &pool = g_pool;
    uint32_t index = pool.formed;
    for (uint32_t i = 0; i < pool.formed && index == pool.formed; ++i)
        if (pool.busy[i] == kIdle) index = i;
    for (uint32_t i = 0; i < pool.formed && index == pool.formed; ++i)
        if (pool.busy[i] == kVacant) index = i;
    const bool fresh = index == pool.formed || pool.busy[index] == kVacant;
    if (index == pool.capacity && !grow(pool)) return nullptr;

    ThreadedWorker *worker = pool.workers[index];
    if (fresh) {
        if (pstctThreadedWorkerForm(worker, host) == nullptr) {
            PLX_ERR_PASS();
            return nullptr;
        }
        if (index == pool.formed) ++pool.formed;
        pool.busy[index] = kIdle;
    }
    if (!gbThreadedWorkerStart(worker, job, argument, host)) {
        // A worker that failed to start is not trusted again: free it and leave the slot
        // vacant, to be formed afresh by a later start.
        vThreadedWorkerFree(worker);
        pool.busy[index] = kVacant;
        PLX_ERR_PASS();
        return nullptr;
    }
    pool.busy[index] = kBusy;
    return worker;
}

PLANO_API Plx_Bool gbThreadedWorkerPoolWaitUntilCompleted(ThreadedWorker *worker)
{
    Pool &pool = g_pool;
    const int64_t index = find(pool, worker);
    if (index < 0) {
        // Not ours: nothing to wait for (waiting on a worker without an outstanding job
        // would block for ever).
        const uint32_t status = uiThreadedWorkerGetStatus(worker, 0);
        PLX_ERR_START(PLX_ERROR_CALLEE, "not a pooled worker", status);
        return 0;
    }
    uint32_t status;
    if (pool.busy[index] == kBusy) {
        do {
            status = uiThreadedWorkerGetStatus(worker, 1);
        } while (status < THREADED_WORKER_COMPLETED);
    } else {
        status = uiThreadedWorkerGetStatus(worker, 0);  // already waited for
    }
    pool.busy[index] = kIdle;
    if (status == THREADED_WORKER_COMPLETED) return 1;
    if (status != THREADED_WORKER_SEMAPHORE_FAILED) {
        // Hand the failed job's own records to this thread, so the trace reads from the
        // job's origin outwards.
        plx_err_flush_trace();
        for (uint32_t i = 0; i < worker->error_count; ++i) {
            const Plx_ErrorRecord &r = worker->errors[i];
            plx_err_register_fileline(r.function, r.code, r.file, r.line, r.message, r.number);
        }
    }
    PLX_ERR_PASS_MSG("the job did not complete successfully", status);
    return 0;
}

PLANO_API uint32_t uiThreadedWorkerPoolGetStatus(ThreadedWorker *worker, int32_t wait)
{
    return uiThreadedWorkerGetStatus(worker, wait);
}

PLANO_API int32_t vThreadedWorkerPoolAbort(ThreadedWorker *worker)
{
    return vThreadedWorkerAbort(worker);
}

PLANO_API Plx_Bool gbThreadedWorkerPoolAbortRequested(const ThreadedWorker *worker)
{
    return gbThreadedWorkerAbortRequested(worker);
}

PLANO_API void vThreadedWorkerPoolFree(void)
{
    Pool &pool = g_pool;
    if (pool.capacity == 0) return;
    for (uint32_t i = 0; i < pool.formed; ++i)
        if (pool.busy[i] != kVacant) vThreadedWorkerFree(pool.workers[i]);
    for (uint32_t b = 0; b < pool.capacity; b += kBlock) std::free(pool.workers[b]);
    std::free(pool.workers);
    std::free(pool.busy);
    pool = Pool{};
}

}  // extern "C"
