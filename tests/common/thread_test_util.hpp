// Helpers of the thread tests: a gate jobs can wait at, trace readers, and a fixture that
// starts every test with an empty worker pool and a fresh reference host.
#ifndef PLANO_TESTS_THREAD_TEST_UTIL_HPP
#define PLANO_TESTS_THREAD_TEST_UTIL_HPP

#include <gtest/gtest.h>

#include <condition_variable>
#include <mutex>
#include <string>

#include "plano/threads.h"
#include "plano_host/host.h"

namespace threads_test {

class Gate {
public:
    void wait()
    {
        std::unique_lock<std::mutex> lock(mutex_);
        wake_.wait(lock, [this] { return open_; });
    }
    void open()
    {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            open_ = true;
        }
        wake_.notify_all();
    }

private:
    std::mutex mutex_;
    std::condition_variable wake_;
    bool open_ = false;
};

inline Plx_ErrorRecord trace_record(uint32_t i)
{
    Plx_ErrorRecord r{};
    r.code = -1;
    plx_err_get_error(i, &r);
    return r;
}

inline Plx_ErrorRecord last_record() { return trace_record(plx_err_get_error_count() - 1); }

class WithHost : public ::testing::Test {
protected:
    void SetUp() override
    {
        vThreadedWorkerPoolFree();
        host_ = plano_host_new(2);
        ASSERT_NE(host_, nullptr);
        table_ = plano_host_interface(host_);
    }
    void TearDown() override
    {
        vThreadedWorkerPoolFree();
        plano_host_free(host_);
    }
    PlanoHost *host_ = nullptr;
    const ThreadHostInterface *table_ = nullptr;
};

}  // namespace threads_test

#endif
