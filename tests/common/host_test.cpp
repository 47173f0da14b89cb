// The reference host's table: semaphores honour their maximum, threads run and join, and
// handles outlive the host that made them.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "plano_host/host.h"

namespace {

uint32_t set_flag(void *block)
{
    static_cast<std::atomic<int> *>(block)->store(1);
    return 0;
}

std::atomic<int> g_reported{-1};
void remember(void *, int32_t percentage) { g_reported = percentage; }

}  // namespace

TEST(ReferenceHost, SemaphoresHonourTheirMaximum)
{
    PlanoHost *host = plano_host_new(1);
    const ThreadHostInterface *t = plano_host_interface(host);
    void *s = nullptr;
    ASSERT_TRUE(t->create_semaphore(t->semaphore_context, &s, 1, 1, 0));
    EXPECT_FALSE(t->release_semaphore(t->semaphore_context, s));  // would exceed 1
    EXPECT_TRUE(t->wait_semaphore(t->semaphore_context, s));
    EXPECT_TRUE(t->release_semaphore(t->semaphore_context, s));
    void *bad = nullptr;
    EXPECT_FALSE(t->create_semaphore(t->semaphore_context, &bad, 2, 1, 0));
    // The engine's processor semaphore is null until initialised: waits pass straight through.
    EXPECT_TRUE(t->wait_semaphore(t->semaphore_context, nullptr));
    EXPECT_TRUE(t->release_semaphore(t->semaphore_context, nullptr));
    EXPECT_EQ(plano_host_live_semaphores(host), 1);
    plano_host_free(host);

    // Made by a host that is gone, destroyed through another one's table.
    PlanoHost *other = plano_host_new(1);
    const ThreadHostInterface *u = plano_host_interface(other);
    u->destroy_semaphore(u->semaphore_context, s);
    EXPECT_EQ(plano_host_live_semaphores(other), 0);
    plano_host_free(other);
}

TEST(ReferenceHost, ThreadsRunAndJoin)
{
    PlanoHost *host = plano_host_new(3);
    const ThreadHostInterface *t = plano_host_interface(host);
    EXPECT_EQ(t->thread_count(t->thread_count_context), 3u);
    std::atomic<int> a{0}, b{0};
    int32_t ida = -1, idb = -1;
    ASSERT_TRUE(t->create_thread(t->thread_context, &ida, set_flag, &a, 2, 0, 0));
    ASSERT_TRUE(t->create_thread(t->thread_context, &idb, set_flag, &b, 2, 0, 0));
    EXPECT_GE(ida, 0);
    EXPECT_GE(idb, 0);
    EXPECT_NE(ida, idb);
    t->close_thread(t->thread_context, ida);
    t->close_thread(t->thread_context, idb);
    t->close_thread(t->thread_context, -1);  // a worker that never had a thread
    EXPECT_EQ(a.load() + b.load(), 2);
    EXPECT_EQ(plano_host_threads_created(host), 2u);
    plano_host_free(host);
}

TEST(ReferenceHost, ProgressAndInterrupt)
{
    PlanoHost *host = plano_host_new(0);
    const ThreadHostInterface *t = plano_host_interface(host);
    EXPECT_GE(plano_host_jobs(host), 1u);
    EXPECT_EQ(plano_host_last_progress(host), -1);
    plano_host_set_progress_callback(host, remember, nullptr);
    t->progress(t->callback_context, 40);
    EXPECT_EQ(plano_host_last_progress(host), 40);
    EXPECT_EQ(g_reported.load(), 40);
    EXPECT_EQ(t->interrupt(t->callback_context), 0);
    std::thread([host] { plano_host_request_interrupt(host, 1); }).join();
    EXPECT_NE(t->interrupt(t->callback_context), 0);
    plano_host_free(host);
}
