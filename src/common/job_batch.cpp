// Running one threaded operation's jobs over the worker pool.
#include "common/job_batch.hpp"

#include <exception>

#include "common/internal.hpp"

namespace plano {

namespace {

// A copy of the calling thread's trace, put back after later failures have replaced it.
struct TraceCopy {
    uint32_t count = 0;
    Plx_ErrorRecord records[PLX_ERROR_TRACE_CAPACITY];

    void save()
    {
        count = 0;
        const uint32_t n = plx_err_get_error_count();
        for (uint32_t i = 0; i < n && i < PLX_ERROR_TRACE_CAPACITY; ++i)
            if (plx_err_get_error(i, &records[count])) ++count;
    }
    void restore() const
    {
        plx_err_flush_trace();
        for (uint32_t i = 0; i < count; ++i) {
            const Plx_ErrorRecord &r = records[i];
            plx_err_register_fileline(r.function, r.code, r.file, r.line, r.message, r.number);
        }
    }
};

}  // namespace

uint32_t job_count(const ThreadHostInterface *host)
{
    if (host == nullptr || host->thread_count == nullptr) return 1;
    const uint32_t n = host->thread_count(host->thread_count_context);
    return n == 0 ? 1 : n;
}

Band band_of(uint32_t i, uint32_t n, uint32_t total)
{
    const uint64_t first = uint64_t(i) * total / n;
    const uint64_t end = (uint64_t(i) + 1) * total / n;
    return Band{uint32_t(first), uint32_t(end - first)};
}

// Runs one job on the calling thread under the processor semaphore, as a worker would.
bool run_here(const ThreadHostInterface *host, ThreadedJobFunction job, void *record)
{
    void *const processor = processor_semaphore();
    if (host != nullptr && host->wait_semaphore != nullptr) host->wait_semaphore(host->semaphore_context, processor);
    bool ok;
    try {
        ok = job(record) != 0;
        if (!ok) PLX_ERR_PASS();
    } catch (const std::exception &e) {
        PLX_ERR_START(PLX_ERROR_CALLEE, e.what(), 0);
        ok = false;
    } catch (...) {
        PLX_ERR_START(PLX_ERROR_CALLEE, "an exception escaped the job", 0);
        ok = false;
    }
    if (host != nullptr && host->release_semaphore != nullptr)
        host->release_semaphore(host->semaphore_context, processor);
    return ok;
}

JobsResult run_jobs(const ThreadHostInterface *host, ThreadedJobFunction job, void *records,
                    std::size_t record_size, uint32_t n, ThreadedWorker **workers)
{
    auto record = [&](uint32_t i) { return static_cast<char *>(records) + std::size_t(i) * record_size; };
    if (host == nullptr) {
        for (uint32_t i = 0; i < n; ++i)
            if (!run_here(nullptr, job, record(i))) return JobsResult::job_failed;
        return JobsResult::ok;
    }
    // Jobs 1..n-1 go to pooled workers, all started before any wait; job 0 runs here
    // meanwhile, so the calling thread works instead of sleeping through the first wait.
    JobsResult result = JobsResult::ok;
    TraceCopy first_failure;
    uint32_t started = 1;
    for (; started < n; ++started) {
        workers[started] = pThreadedWorkerPoolStart(job, record(started), host);
        if (workers[started] == nullptr) {
            result = JobsResult::start_failed;
            first_failure.save();
            break;
        }
    }
    if (result == JobsResult::ok && !run_here(host, job, record(0))) {
        result = JobsResult::job_failed;
        first_failure.save();
    }
    for (uint32_t i = 1; i < started; ++i) {
        if (!gbThreadedWorkerPoolWaitUntilCompleted(workers[i]) && result == JobsResult::ok) {
            result = JobsResult::job_failed;
            first_failure.save();
        }
    }
    if (result != JobsResult::ok) first_failure.restore();
    return result;
}

const char *jobs_failure_message(JobsResult result)
{
    return result == JobsResult::start_failed ? "Failed to start one or more thread workers"
                                              : "Failed to complete one or more thread workers";
}

}  // namespace plano
