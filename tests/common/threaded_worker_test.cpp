// Threaded workers, the worker pool and the processor semaphore, on the reference host.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <stdexcept>
#include <thread>
#include <vector>

#include "thread_test_util.hpp"

using threads_test::Gate;
using threads_test::last_record;
using threads_test::trace_record;

namespace {

using Workers = threads_test::WithHost;

// Leaves no pooled thread behind when the test program ends.
struct FreePoolAtExit : ::testing::Environment {
    void TearDown() override { vThreadedWorkerPoolFree(); }
};
const auto *const kFreePool = ::testing::AddGlobalTestEnvironment(new FreePoolAtExit);

struct Probe {
    Gate *gate = nullptr;
    std::thread::id thread;
    std::atomic<bool> ran{false};
};

Plx_Bool probe_job(void *arg)
{
    auto *p = static_cast<Probe *>(arg);
    if (p->gate != nullptr) p->gate->wait();
    p->thread = std::this_thread::get_id();
    p->ran = true;
    return 1;
}

Plx_Bool failing_job(void *)
{
    PLX_ERR_START(PLX_ERROR_NOT_ENOUGH_DATA, "too few points", 42);
    return 0;
}

Plx_Bool throwing_job(void *) { throw std::runtime_error("boom"); }

void wait_direct(ThreadedWorker *w)
{
    while (uiThreadedWorkerGetStatus(w, 1) < THREADED_WORKER_COMPLETED) {
    }
}

}  // namespace

TEST_F(Workers, PooledWorkerIsReusedOnItsThread)
{
    Probe a, b;
    ThreadedWorker *first = pThreadedWorkerPoolStart(probe_job, &a, table_);
    ASSERT_NE(first, nullptr);
    ASSERT_TRUE(gbThreadedWorkerPoolWaitUntilCompleted(first));
    ThreadedWorker *second = pThreadedWorkerPoolStart(probe_job, &b, table_);
    ASSERT_EQ(second, first);
    ASSERT_TRUE(gbThreadedWorkerPoolWaitUntilCompleted(second));
    EXPECT_TRUE(gbThreadedWorkerPoolWaitUntilCompleted(second));  // a second wait does not block
    EXPECT_TRUE(a.ran && b.ran);
    EXPECT_EQ(a.thread, b.thread);
    EXPECT_NE(a.thread, std::this_thread::get_id());
    EXPECT_EQ(plano_host_threads_created(host_), 1u);
    EXPECT_EQ(uiThreadedWorkerPoolGetStatus(first, 0), THREADED_WORKER_COMPLETED);
}

TEST_F(Workers, StartBlocksUntilThePreviousJobCompleted)
{
    ThreadedWorker *w = pstctThreadedWorkerAlloc(table_);
    ASSERT_NE(w, nullptr);
    EXPECT_EQ(w->owned, 1u);
    EXPECT_EQ(w->thread_id, -1);
    Gate gate;
    Probe held, next;
    held.gate = &gate;
    ASSERT_TRUE(gbThreadedWorkerStart(w, probe_job, &held, table_));
    std::atomic<bool> second_started{false};
    std::thread starter([&] {
        EXPECT_TRUE(gbThreadedWorkerStart(w, probe_job, &next, table_));
        second_started = true;
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    EXPECT_FALSE(second_started.load());
    EXPECT_FALSE(next.ran.load());
    gate.open();
    starter.join();
    wait_direct(w);
    EXPECT_TRUE(held.ran && next.ran);
    EXPECT_EQ(held.thread, next.thread);
    vThreadedWorkerFree(w);
    EXPECT_EQ(plano_host_threads_created(host_), 1u);
    EXPECT_EQ(plano_host_live_semaphores(host_), 0);
}

TEST_F(Workers, FreeRunsTheOutstandingJobFirst)
{
    // Freed straight after its start, a worker must still run the job it was given.
    for (int i = 0; i < 50; ++i) {
        ThreadedWorker record;
        ASSERT_EQ(pstctThreadedWorkerForm(&record, table_), &record);
        EXPECT_EQ(record.owned, 0u);
        Probe p;
        ASSERT_TRUE(gbThreadedWorkerStart(&record, probe_job, &p, nullptr));  // keeps its own table
        vThreadedWorkerFree(&record);
        ASSERT_TRUE(p.ran.load()) << "round " << i;
    }
    EXPECT_EQ(plano_host_live_semaphores(host_), 0);
}

TEST_F(Workers, FailedJobReportsItsOriginAndTheWorkerStaysUsable)
{
    ThreadedWorker *w = pThreadedWorkerPoolStart(failing_job, nullptr, table_);
    ASSERT_NE(w, nullptr);
    EXPECT_FALSE(gbThreadedWorkerPoolWaitUntilCompleted(w));
    const Plx_ErrorRecord origin = trace_record(0), last = last_record();
    EXPECT_STREQ(origin.function, "failing_job");
    EXPECT_EQ(origin.code, PLX_ERROR_NOT_ENOUGH_DATA);
    EXPECT_STREQ(origin.message, "too few points");
    EXPECT_EQ(origin.number, 42);
    EXPECT_STREQ(last.function, "gbThreadedWorkerPoolWaitUntilCompleted");
    EXPECT_EQ(last.code, PLX_ERROR_CALLEE);
    EXPECT_EQ(last.number, THREADED_WORKER_JOB_FAILED);

    ThreadedWorker *again = pThreadedWorkerPoolStart(throwing_job, nullptr, table_);
    ASSERT_EQ(again, w);
    EXPECT_FALSE(gbThreadedWorkerPoolWaitUntilCompleted(again));
    EXPECT_STREQ(trace_record(0).message, "boom");
    EXPECT_EQ(last_record().number, THREADED_WORKER_EXCEPTION);

    Probe p;
    ASSERT_EQ(pThreadedWorkerPoolStart(probe_job, &p, table_), w);
    EXPECT_TRUE(gbThreadedWorkerPoolWaitUntilCompleted(w));
    EXPECT_EQ(plano_host_threads_created(host_), 1u);
}

TEST_F(Workers, PoolGrowsInBlocksOfTen)
{
    Gate gate;
    std::vector<Probe> probes(20);
    std::vector<ThreadedWorker *> w;
    for (Probe &p : probes) {
        p.gate = &gate;
        w.push_back(pThreadedWorkerPoolStart(probe_job, &p, table_));
        ASSERT_NE(w.back(), nullptr);
    }
    for (int i = 1; i < 10; ++i) EXPECT_EQ(w[i], w[0] + i);
    for (int i = 11; i < 20; ++i) EXPECT_EQ(w[i], w[10] + i - 10);
    EXPECT_TRUE(w[10] < w[0] || w[10] >= w[0] + 10);  // the 11th worker opens a second block
    gate.open();
    for (ThreadedWorker *x : w) EXPECT_TRUE(gbThreadedWorkerPoolWaitUntilCompleted(x));
    EXPECT_EQ(plano_host_threads_created(host_), 20u);
    // Waited-for workers are handed out again, first index first.
    Probe p;
    EXPECT_EQ(pThreadedWorkerPoolStart(probe_job, &p, table_), w[0]);
    EXPECT_TRUE(gbThreadedWorkerPoolWaitUntilCompleted(w[0]));
    vThreadedWorkerPoolFree();
    EXPECT_EQ(plano_host_live_semaphores(host_), 0);
}

TEST_F(Workers, NullAndForeignWorkers)
{
    EXPECT_EQ(uiThreadedWorkerGetStatus(nullptr, 1), THREADED_WORKER_NULL);
    EXPECT_FALSE(gbThreadedWorkerPoolWaitUntilCompleted(nullptr));
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_CALLEE);
    EXPECT_EQ(trace_record(0).number, int64_t(THREADED_WORKER_NULL));
    EXPECT_EQ(vThreadedWorkerAbort(nullptr), 0);
    EXPECT_EQ(gbThreadedWorkerAbortRequested(nullptr), 0);
    vThreadedWorkerFree(nullptr);

    PLX_ERR_START(PLX_ERROR_NO_DATA, "marker", 0);
    EXPECT_EQ(pstctThreadedWorkerForm(nullptr, table_), nullptr);
    EXPECT_FALSE(gbThreadedWorkerStart(nullptr, probe_job, nullptr, table_));
    EXPECT_EQ(plx_err_get_error_count(), 1u);  // nothing registered for a null worker

    // A worker of the caller's own is not the pool's to wait for.
    ThreadedWorker *own = pstctThreadedWorkerAlloc(table_);
    ASSERT_NE(own, nullptr);
    EXPECT_FALSE(gbThreadedWorkerPoolWaitUntilCompleted(own));
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_CALLEE);
    EXPECT_EQ(vThreadedWorkerPoolAbort(own), 1);
    EXPECT_EQ(gbThreadedWorkerPoolAbortRequested(own), 1);
    Probe p;
    ASSERT_TRUE(gbThreadedWorkerStart(own, probe_job, &p, table_));
    EXPECT_EQ(gbThreadedWorkerAbortRequested(own), 0);  // a start clears the request
    wait_direct(own);
    vThreadedWorkerFree(own);

    ThreadHostInterface lacking = *table_;
    lacking.create_thread = nullptr;
    ThreadedWorker record;
    EXPECT_EQ(pstctThreadedWorkerForm(&record, &lacking), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_ILLEGAL_ARGUMENT);
    EXPECT_EQ(pThreadedWorkerPoolStart(nullptr, nullptr, table_), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_ILLEGAL_ARGUMENT);
}

namespace {

struct Overlap {
    std::atomic<int> running{0}, most{0};
};

Plx_Bool overlap_job(void *arg)
{
    auto *o = static_cast<Overlap *>(arg);
    const int now = ++o->running;
    int seen = o->most.load();
    while (now > seen && !o->most.compare_exchange_weak(seen, now)) {
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(15));
    --o->running;
    return 1;
}

int most_at_once(const ThreadHostInterface *table, int jobs)
{
    Overlap o;
    std::vector<ThreadedWorker *> w;
    for (int i = 0; i < jobs; ++i) w.push_back(pThreadedWorkerPoolStart(overlap_job, &o, table));
    for (ThreadedWorker *x : w) EXPECT_TRUE(gbThreadedWorkerPoolWaitUntilCompleted(x));
    return o.most.load();
}

}  // namespace

TEST_F(Workers, ProcessorSemaphoreBoundsConcurrency)
{
    struct Destroy {
        const ThreadHostInterface *t;
        ~Destroy() { vThreadedWorkerDestroyProcessorSemaphore(t); }
    } destroy{table_};
    vThreadedWorkerInitialiseProcessorSemaphore(table_, 2);
    vThreadedWorkerInitialiseProcessorSemaphore(table_, 6);  // already there: unchanged
    EXPECT_LE(most_at_once(table_, 6), 2);
    vThreadedWorkerDestroyProcessorSemaphore(table_);
    vThreadedWorkerInitialiseProcessorSemaphore(table_, 1);
    EXPECT_EQ(most_at_once(table_, 4), 1);
    vThreadedWorkerDestroyProcessorSemaphore(table_);
    vThreadedWorkerPoolFree();
    EXPECT_EQ(plano_host_live_semaphores(host_), 0);
}

TEST_F(Workers, ThreadCreationFailuresGiveTheirCodes)
{
    Probe p;
    plano_host_fail_thread_creation(host_, 0, PLANO_HOST_FAIL_RETURN);
    EXPECT_EQ(pThreadedWorkerPoolStart(probe_job, &p, table_), nullptr);
    EXPECT_STREQ(trace_record(0).function, "gbThreadedWorkerStart");
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_CALLEE);
    EXPECT_STREQ(last_record().function, "pThreadedWorkerPoolStart");

    plano_host_fail_thread_creation(host_, 0, PLANO_HOST_FAIL_NEGATIVE_ID);
    EXPECT_EQ(pThreadedWorkerPoolStart(probe_job, &p, table_), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_THREAD);
    EXPECT_EQ(last_record().code, PLX_ERROR_CALLEE);

    // The broken worker was dropped: the pool forms a sound one in its place.
    plano_host_fail_thread_creation(host_, -1, PLANO_HOST_FAIL_RETURN);
    ThreadedWorker *w = pThreadedWorkerPoolStart(probe_job, &p, table_);
    ASSERT_NE(w, nullptr);
    EXPECT_TRUE(gbThreadedWorkerPoolWaitUntilCompleted(w));
    EXPECT_TRUE(p.ran.load());
    EXPECT_EQ(plano_host_threads_created(host_), 1u);
    vThreadedWorkerPoolFree();
    EXPECT_EQ(plano_host_live_semaphores(host_), 0);
}

TEST_F(Workers, SemaphoreCreationFailureGivesCode37AndLeaksNothing)
{
    ThreadedWorker record;
    std::memset(&record, 0xAB, sizeof record);
    plano_host_fail_semaphore_creation(host_, 2);
    EXPECT_EQ(pstctThreadedWorkerForm(&record, table_), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_THREAD);
    EXPECT_EQ(plano_host_live_semaphores(host_), 0);
    EXPECT_EQ(record.thread_id, int32_t(0xABABABAB));  // the caller's record is untouched

    plano_host_fail_semaphore_creation(host_, 0);
    EXPECT_EQ(pstctThreadedWorkerAlloc(table_), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_THREAD);
    EXPECT_STREQ(last_record().function, "pstctThreadedWorkerAlloc");
    Probe p;
    EXPECT_EQ(pThreadedWorkerPoolStart(probe_job, &p, table_), nullptr);
    EXPECT_EQ(trace_record(0).code, PLX_ERROR_THREAD);
    EXPECT_STREQ(last_record().function, "pThreadedWorkerPoolStart");
    plano_host_fail_semaphore_creation(host_, -1);
    ThreadedWorker *w = pThreadedWorkerPoolStart(probe_job, &p, table_);
    ASSERT_NE(w, nullptr);
    EXPECT_TRUE(gbThreadedWorkerPoolWaitUntilCompleted(w));
}
