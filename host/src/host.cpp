// The reference host on std::thread, a mutex and condition variables.
//
// The table's contexts point to a reference-counted core: the host holds one reference and
// every thread and semaphore made through it holds one, so pooled workers that keep an old
// table can still close their threads and destroy their semaphores after the host is freed.
// Threads live in one process-wide registry keyed by identifier, so any table can close them.
#include "plano_host/host.h"

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <new>
#include <thread>
#include <unordered_map>

namespace {

struct Core {
    std::atomic<int32_t> references{1};
    std::atomic<uint32_t> jobs{1};
    std::atomic<int32_t> interrupt{0};
    std::atomic<int32_t> last_progress{-1};
    void (*progress_callback)(void *, int32_t) = nullptr;
    void *progress_user = nullptr;
    std::atomic<uint32_t> threads_created{0};
    std::atomic<uint32_t> semaphores_created{0};
    std::atomic<int32_t> live_semaphores{0};
    std::atomic<int32_t> thread_failure_after{-1};
    std::atomic<int32_t> thread_failure_mode{PLANO_HOST_FAIL_RETURN};
    std::atomic<int32_t> semaphore_failure_after{-1};
};

void retain(Core *core) { core->references.fetch_add(1); }

void release(Core *core)
{
    if (core->references.fetch_sub(1) == 1) delete core;
}

// True when the creation is to fail; counts the successes left otherwise.
bool injected_failure(std::atomic<int32_t> &after)
{
    int32_t left = after.load();
    while (left > 0 && !after.compare_exchange_weak(left, left - 1)) {
    }
    return left == 0;
}

struct Semaphore {
    std::mutex mutex;
    std::condition_variable wake;
    uint32_t count;
    uint32_t maximum;
    Core *core;
};

struct ThreadEntry {
    std::thread thread;
    Core *core;
};

struct Registry {
    std::mutex mutex;
    std::unordered_map<int32_t, ThreadEntry> threads;
    int32_t next_id = 0;
};

// Never destroyed: threads of workers nobody freed may still be waiting at exit, and
// destroying their std::thread objects would end the process.
Registry &registry()
{
    static Registry *r = new Registry;
    return *r;
}

void report_progress(void *context, int32_t percentage)
{
    Core *core = static_cast<Core *>(context);
    core->last_progress.store(percentage);
    if (core->progress_callback != nullptr) core->progress_callback(core->progress_user, percentage);
}

int32_t query_interrupt(void *context) { return static_cast<Core *>(context)->interrupt.load(); }

int32_t create_thread(void *context, int32_t *thread_id, ThreadStartRoutine routine, void *start_block,
                      int32_t, int32_t, int32_t)
{
    Core *core = static_cast<Core *>(context);
    if (thread_id == nullptr || routine == nullptr) return 0;
    if (injected_failure(core->thread_failure_after)) {
        if (core->thread_failure_mode.load() != PLANO_HOST_FAIL_NEGATIVE_ID) return 0;
        *thread_id = -1;
        return 1;
    }
    Registry &reg = registry();
    std::lock_guard<std::mutex> lock(reg.mutex);
    const int32_t id = reg.next_id;
    try {
        ThreadEntry &entry = reg.threads[id];
        entry.core = core;
        entry.thread = std::thread([routine, start_block] { routine(start_block); });
    } catch (...) {
        reg.threads.erase(id);
        return 0;
    }
    reg.next_id = id == INT32_MAX ? 0 : id + 1;
    retain(core);
    core->threads_created.fetch_add(1);
    *thread_id = id;
    return 1;
}

void close_thread(void *, int32_t thread_id)
{
    if (thread_id < 0) return;
    Registry &reg = registry();
    ThreadEntry entry;
    {
        std::lock_guard<std::mutex> lock(reg.mutex);
        auto it = reg.threads.find(thread_id);
        if (it == reg.threads.end()) return;
        entry = std::move(it->second);
        reg.threads.erase(it);
    }
    if (entry.thread.joinable()) {
        if (entry.thread.get_id() == std::this_thread::get_id())
            entry.thread.detach();
        else
            entry.thread.join();
    }
    release(entry.core);
}

int32_t create_semaphore(void *context, void **handle, uint32_t initial, uint32_t maximum, int32_t)
{
    Core *core = static_cast<Core *>(context);
    if (handle == nullptr || maximum == 0 || initial > maximum) return 0;
    if (injected_failure(core->semaphore_failure_after)) return 0;
    Semaphore *s = new (std::nothrow) Semaphore;
    if (s == nullptr) return 0;
    s->count = initial;
    s->maximum = maximum;
    s->core = core;
    retain(core);
    core->semaphores_created.fetch_add(1);
    core->live_semaphores.fetch_add(1);
    *handle = s;
    return 1;
}

// A null handle is the engine's processor semaphore before any host initialised it: there is
// nothing to wait for.
int32_t wait_semaphore(void *, void *handle)
{
    if (handle == nullptr) return 1;
    Semaphore *s = static_cast<Semaphore *>(handle);
    std::unique_lock<std::mutex> lock(s->mutex);
    s->wake.wait(lock, [s] { return s->count > 0; });
    --s->count;
    return 1;
}

int32_t release_semaphore(void *, void *handle)
{
    if (handle == nullptr) return 1;
    Semaphore *s = static_cast<Semaphore *>(handle);
    {
        std::lock_guard<std::mutex> lock(s->mutex);
        if (s->count >= s->maximum) return 0;
        ++s->count;
    }
    s->wake.notify_one();
    return 1;
}

void destroy_semaphore(void *, void *handle)
{
    if (handle == nullptr) return;
    Semaphore *s = static_cast<Semaphore *>(handle);
    Core *core = s->core;
    delete s;
    core->live_semaphores.fetch_sub(1);
    release(core);
}

uint32_t thread_count(void *context) { return static_cast<Core *>(context)->jobs.load(); }

uint32_t hardware_jobs()
{
    const unsigned n = std::thread::hardware_concurrency();
    return n == 0 ? 1 : n;
}

}  // namespace

struct PlanoHost {
    Core *core;
    ThreadHostInterface table;
};

extern "C" {

PlanoHost *plano_host_new(uint32_t jobs)
{
    PlanoHost *host = new (std::nothrow) PlanoHost;
    if (host == nullptr) return nullptr;
    host->core = new (std::nothrow) Core;
    if (host->core == nullptr) {
        delete host;
        return nullptr;
    }
    host->core->jobs.store(jobs == 0 ? hardware_jobs() : jobs);
    ThreadHostInterface &t = host->table;
    t = ThreadHostInterface{};
    t.callback_context = host->core;
    t.progress = report_progress;
    t.interrupt = query_interrupt;
    t.create_thread = create_thread;
    t.close_thread = close_thread;
    t.thread_context = host->core;
    t.create_semaphore = create_semaphore;
    t.wait_semaphore = wait_semaphore;
    t.release_semaphore = release_semaphore;
    t.destroy_semaphore = destroy_semaphore;
    t.semaphore_context = host->core;
    t.thread_count = thread_count;
    t.thread_count_context = host->core;
    return host;
}

void plano_host_free(PlanoHost *host)
{
    if (host == nullptr) return;
    release(host->core);
    delete host;
}

const ThreadHostInterface *plano_host_interface(const PlanoHost *host)
{
    return host != nullptr ? &host->table : nullptr;
}

void plano_host_fill(const PlanoHost *host, ThreadHostInterface *table)
{
    if (host != nullptr && table != nullptr) *table = host->table;
}

void plano_host_set_jobs(PlanoHost *host, uint32_t jobs)
{
    if (host != nullptr) host->core->jobs.store(jobs == 0 ? hardware_jobs() : jobs);
}

uint32_t plano_host_jobs(const PlanoHost *host) { return host != nullptr ? host->core->jobs.load() : 0; }

void plano_host_request_interrupt(PlanoHost *host, int32_t value)
{
    if (host != nullptr) host->core->interrupt.store(value);
}

int32_t plano_host_last_progress(const PlanoHost *host)
{
    return host != nullptr ? host->core->last_progress.load() : -1;
}

void plano_host_set_progress_callback(PlanoHost *host, void (*callback)(void *, int32_t), void *user)
{
    if (host == nullptr) return;
    host->core->progress_callback = callback;
    host->core->progress_user = user;
}

uint32_t plano_host_threads_created(const PlanoHost *host)
{
    return host != nullptr ? host->core->threads_created.load() : 0;
}

uint32_t plano_host_semaphores_created(const PlanoHost *host)
{
    return host != nullptr ? host->core->semaphores_created.load() : 0;
}

int32_t plano_host_live_semaphores(const PlanoHost *host)
{
    return host != nullptr ? host->core->live_semaphores.load() : 0;
}

void plano_host_fail_thread_creation(PlanoHost *host, int32_t after, int32_t mode)
{
    if (host == nullptr) return;
    host->core->thread_failure_mode.store(mode);
    host->core->thread_failure_after.store(after);
}

void plano_host_fail_semaphore_creation(PlanoHost *host, int32_t after)
{
    if (host != nullptr) host->core->semaphore_failure_after.store(after);
}

}  // extern "C"
