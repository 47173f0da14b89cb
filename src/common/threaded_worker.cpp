// Threaded workers: one long-lived host thread per worker running one job at a time, and
// the process-wide processor semaphore that bounds how many jobs run at once.
#include <atomic>
#include <cstdlib>
#include <cstring>
#include <exception>

#include "common/internal.hpp"
#include "common/job_batch.hpp"
#include "plano/threads.h"

static_assert(sizeof(ThreadHostInterface) == 18 * sizeof(void *),
              "the host table is 18 pointer-sized slots");

namespace {

// The processor semaphore: null until a host initialises it. Atomic because worker threads
// read it while the controlling thread may set it.
std::atomic<void *> g_processor_semaphore{nullptr};

bool sem_wait(const ThreadHostInterface &h, void *handle)
{
    return h.wait_semaphore(h.semaphore_context, handle) != 0;
}

bool sem_release(const ThreadHostInterface &h, void *handle)
{
    return h.release_semaphore(h.semaphore_context, handle) != 0;
}

bool host_usable(const ThreadHostInterface *h)
{
    return h != nullptr && h->create_thread != nullptr && h->close_thread != nullptr &&
           h->create_semaphore != nullptr && h->wait_semaphore != nullptr &&
           h->release_semaphore != nullptr && h->destroy_semaphore != nullptr;
}

void *ThreadedWorker::*const kSemaphores[] = {
    &ThreadedWorker::start_semaphore, &ThreadedWorker::idle_semaphore, &ThreadedWorker::status_lock,
    &ThreadedWorker::completion_semaphore, &ThreadedWorker::spare_semaphore};

// Keeps the calling thread's trace (a failed job's records) in the worker, origin first.
void keep_trace(ThreadedWorker *worker)
{
    uint32_t n = plx_err_get_error_count();
    if (n > THREADED_WORKER_ERROR_RECORDS) n = THREADED_WORKER_ERROR_RECORDS;
    uint32_t kept = 0;
    for (uint32_t i = 0; i < n; ++i)
        if (plx_err_get_error(i, &worker->errors[kept])) ++kept;
    worker->error_count = kept;
}

}  // namespace

void *plano::processor_semaphore() { return g_processor_semaphore.load(); }

extern "C" {

PLANO_API ThreadedWorker *pstctThreadedWorkerForm(ThreadedWorker *worker, const ThreadHostInterface *host)
{
    if (worker == nullptr) return nullptr;
    if (!host_usable(host)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "host table without thread or semaphore functions", 0);
        return nullptr;
    }
    // Built aside and copied at the end, so a failure leaves the caller's record as it was.
    ThreadedWorker w;
    std::memset(&w, 0, sizeof w);
    static const uint32_t counts[5][2] = {{0, 1}, {1, 1}, {1, 1}, {1, 100}, {1, 1}};
    for (int i = 0; i < 5; ++i) {
        void *handle = nullptr;
        if (!host->create_semaphore(host->semaphore_context, &handle, counts[i][0], counts[i][1], 0)) {
            // Unlike a bare failure path, the semaphores made so far are given back.
            for (int j = 0; j < i; ++j) host->destroy_semaphore(host->semaphore_context, w.*kSemaphores[j]);
            PLX_ERR_START(PLX_ERROR_THREAD, "the host could not create a semaphore", i);
            return nullptr;
        }
        w.*kSemaphores[i] = handle;
    }
    w.host = *host;
    w.status = THREADED_WORKER_RUNNING;
    w.owned = 0;
    w.thread_id = -1;
    w.persistent = 1;
    *worker = w;
    return worker;
}

PLANO_API ThreadedWorker *pstctThreadedWorkerAlloc(const ThreadHostInterface *host)
{
    ThreadedWorker *worker = PLX_ALLOC(ThreadedWorker, 1);
    if (worker == nullptr) return nullptr;
    if (pstctThreadedWorkerForm(worker, host) == nullptr) {
        std::free(worker);
        PLX_ERR_PASS();
        return nullptr;
    }
    worker->owned = 1;
    return worker;
}

PLANO_API Plx_Bool gbThreadedWorkerStart(ThreadedWorker *worker, ThreadedJobFunction job,
                                         void *argument, const ThreadHostInterface *host)
{
    if (worker == nullptr) return 0;
    if (job == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null job function", 0);
        return 0;
    }
    const ThreadHostInterface given = host != nullptr ? *host : worker->host;
    if (!host_usable(&given)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "host table without thread or semaphore functions", 0);
        return 0;
    }
    // Blocks until the previous job has completed. The table is copied only afterwards: the
    // worker's thread reads its copy when it wakes for a job.
    if (!sem_wait(given, worker->idle_semaphore)) {
        PLX_ERR_START(PLX_ERROR_CALLEE, "waiting for the worker to become idle failed", 0);
        return 0;
    }
    worker->host = given;
    const ThreadHostInterface &h = worker->host;
    worker->stop = 0;
    worker->abort_requested = 0;
    worker->start_block.worker = worker;
    worker->start_block.job = job;
    worker->start_block.argument = argument;
    worker->start_block.persistent = worker->persistent;

    // Every failure below hands the idle semaphore back, so the worker stays usable and can
    // still be freed.
    if (worker->thread_id == -1) {
        if (!h.create_thread(h.thread_context, &worker->thread_id, gbInit, &worker->start_block, 2, 0, 0)) {
            worker->thread_id = -1;  // nothing was created: the next start tries again
            sem_release(h, worker->idle_semaphore);
            PLX_ERR_START(PLX_ERROR_CALLEE, "the host could not create a thread", 0);
            return 0;
        }
    }
    if (worker->thread_id < 0) {
        sem_release(h, worker->idle_semaphore);
        PLX_ERR_START(PLX_ERROR_THREAD, "the host gave a negative thread identifier", worker->thread_id);
        return 0;
    }
    const bool locked = sem_wait(h, worker->status_lock);
    const uint32_t previous = worker->status;
    worker->status = THREADED_WORKER_RUNNING;
    worker->error_count = 0;
    if (locked) sem_release(h, worker->status_lock);
    if (!sem_release(h, worker->start_semaphore)) {
        const bool relocked = sem_wait(h, worker->status_lock);
        worker->status = previous;
        if (relocked) sem_release(h, worker->status_lock);
        sem_release(h, worker->idle_semaphore);
        PLX_ERR_START(PLX_ERROR_CALLEE, "releasing the start semaphore failed", 0);
        return 0;
    }
    return 1;
}

PLANO_API uint32_t uiThreadedWorkerGetStatus(ThreadedWorker *worker, int32_t wait)
{
    if (worker == nullptr) return THREADED_WORKER_NULL;
    const ThreadHostInterface &h = worker->host;
    if (wait != 0 && !sem_wait(h, worker->completion_semaphore)) {
        PLX_ERR_START(PLX_ERROR_CALLEE, "waiting for the completion semaphore failed", 0);
        return THREADED_WORKER_SEMAPHORE_FAILED;
    }
    if (!sem_wait(h, worker->status_lock)) {
        PLX_ERR_START(PLX_ERROR_CALLEE, "taking the status lock failed", 0);
        return THREADED_WORKER_SEMAPHORE_FAILED;
    }
    const uint32_t status = worker->status;
    if (!sem_release(h, worker->status_lock)) {
        PLX_ERR_START(PLX_ERROR_CALLEE, "releasing the status lock failed", 0);
        return THREADED_WORKER_SEMAPHORE_FAILED;
    }
    return status;
}

PLANO_API int32_t vThreadedWorkerAbort(ThreadedWorker *worker)
{
    if (worker == nullptr) return 0;
    worker->abort_requested = 1;
    return 1;
}

PLANO_API Plx_Bool gbThreadedWorkerAbortRequested(const ThreadedWorker *worker)
{
    return worker != nullptr && worker->abort_requested != 0 ? 1 : 0;
}

PLANO_API void vThreadedWorkerFree(ThreadedWorker *worker)
{
    if (worker == nullptr) return;
    const ThreadHostInterface h = worker->host;
    // The stop flag is set only once the worker is idle: set earlier, a thread that has just
    // been woken for a job could see it, end without running the job, and never release the
    // idle semaphore this wait needs.
    sem_wait(h, worker->idle_semaphore);
    worker->stop = 1;
    sem_release(h, worker->start_semaphore);
    h.close_thread(h.thread_context, worker->thread_id);
    for (void *ThreadedWorker::*field : kSemaphores) h.destroy_semaphore(h.semaphore_context, worker->*field);
    if (worker->owned == 1) std::free(worker);
}

PLANO_API uint32_t gbInit(void *start_block)
{
    auto *block = static_cast<ThreadedWorkerStartBlock *>(start_block);
    if (block == nullptr || block->worker == nullptr) return 0xFFFFFFFFu;
    if (!gbThreadedWorkerInternalRun(block->worker)) {
        PLX_ERR_PASS();
        return 0xFFFFFFFFu;
    }
    return 0;
}

PLANO_API Plx_Bool gbThreadedWorkerInternalRun(ThreadedWorker *worker)
{
    if (worker == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null worker", 0);
        return 0;
    }
    worker->persistent = worker->start_block.persistent;
    // The thread works from its own copy of the host table, taken each time it is woken: the
    // controlling thread rewrites the worker's copy at the next start.
    ThreadHostInterface h = worker->host;
    for (;;) {
        sem_wait(h, worker->start_semaphore);
        if (worker->stop != 0) return 1;
        h = worker->host;
        const ThreadedJobFunction job = worker->start_block.job;
        void *const argument = worker->start_block.argument;

        void *const processor = g_processor_semaphore.load();
        sem_wait(h, processor);
        plx_err_flush_trace();  // the records kept on failure are this job's alone
        uint32_t status = THREADED_WORKER_COMPLETED;
        try {
            if (!job(argument)) {
                PLX_ERR_PASS();
                status = THREADED_WORKER_JOB_FAILED;
            }
        } catch (const std::exception &e) {
            PLX_ERR_START(PLX_ERROR_CALLEE, e.what(), 0);
            status = THREADED_WORKER_EXCEPTION;
        } catch (...) {
            PLX_ERR_START(PLX_ERROR_CALLEE, "an exception escaped the job", 0);
            status = THREADED_WORKER_EXCEPTION;
        }
        const bool locked = sem_wait(h, worker->status_lock);
        worker->status = status;
        if (status == THREADED_WORKER_COMPLETED)
            worker->error_count = 0;
        else
            keep_trace(worker);
        if (locked) sem_release(h, worker->status_lock);
        // A failed job releases exactly as a successful one: its waiter must never block.
        sem_release(h, processor);
        sem_release(h, worker->completion_semaphore);
        sem_release(h, worker->idle_semaphore);
    }
}

PLANO_API void vThreadedWorkerInitialiseProcessorSemaphore(const ThreadHostInterface *host, uint32_t count)
{
    // A count of 0 would let no job ever run; it is ignored like a missing table.
    if (host == nullptr || host->create_semaphore == nullptr || count == 0) return;
    if (g_processor_semaphore.load() != nullptr) return;
    void *handle = nullptr;
    if (host->create_semaphore(host->semaphore_context, &handle, count, count, 0) && handle != nullptr)
        g_processor_semaphore.store(handle);
}

PLANO_API void vThreadedWorkerDestroyProcessorSemaphore(const ThreadHostInterface *host)
{
    if (host == nullptr || host->destroy_semaphore == nullptr) return;
    void *handle = g_processor_semaphore.exchange(nullptr);
    if (handle != nullptr) host->destroy_semaphore(host->semaphore_context, handle);
}

}  // extern "C"
