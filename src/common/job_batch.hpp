// Running one threaded operation's jobs: ask the host for n jobs, give job i a band, start
// every job through the pool, then wait for every one.
#ifndef PLANO_SRC_COMMON_JOB_BATCH_HPP
#define PLANO_SRC_COMMON_JOB_BATCH_HPP

#include <cstddef>
#include <cstdint>

#include "plano/threads.h"

namespace plano {

// The number of jobs to split an operation into: the host's thread count (slot 16), at
// least 1; 1 without a host or without slot 16.
uint32_t job_count(const ThreadHostInterface *host);

// Band i of n over `total` rows or columns: [first, first + count). The bands cover every
// row once and differ in size by at most one.
struct Band {
    uint32_t first;
    uint32_t count;
};
Band band_of(uint32_t i, uint32_t n, uint32_t total);

enum class JobsResult { ok, start_failed, job_failed };

// Runs job on records[0..n) (record i at records + i * record_size). With a host, jobs 1..n-1
// are started on pooled workers, all before any wait, and job 0 runs on the calling thread
// meanwhile (under the processor semaphore like any job); without a host all run here, one
// after another. `workers` has room for n addresses. Every started job is waited for, even
// after a failure, so none outlives the caller's data. On failure the trace holds the first
// failure's records; the caller adds its own code-1 record (see jobs_failure_message).
JobsResult run_jobs(const ThreadHostInterface *host, ThreadedJobFunction job, void *records,
                    std::size_t record_size, uint32_t n, ThreadedWorker **workers);

// The processor semaphore handle (null until a host initialises it).
void *processor_semaphore();

// Messages of a caller's code-1 record for the two failures.
const char *jobs_failure_message(JobsResult result);

}  // namespace plano

#endif
