/* The reference host: a ThreadHostInterface on std::thread and counting semaphores, with a
 * job count, a progress callback and an interrupt flag, for tools, tests and benchmarks.
 *
 * Threads and semaphores made through one host's table may be closed or destroyed through
 * any host's table, and stay valid after their host is freed: the engine's pooled workers
 * keep the table they were started with and outlive the call that made them. */
#ifndef PLANO_HOST_HOST_H
#define PLANO_HOST_HOST_H

#include "plano/plano.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct PlanoHost PlanoHost;

/* A host answering `jobs` to the thread-count query (0: the number of hardware threads).
 * Null when out of memory. */
PlanoHost *plano_host_new(uint32_t jobs);
void plano_host_free(PlanoHost *host);

/* The host's table, valid while the host lives. */
const ThreadHostInterface *plano_host_interface(const PlanoHost *host);
/* Copies the host's table into caller storage (for callers that change a slot). */
void plano_host_fill(const PlanoHost *host, ThreadHostInterface *table);

void plano_host_set_jobs(PlanoHost *host, uint32_t jobs);
uint32_t plano_host_jobs(const PlanoHost *host);

/* Sets the value the interrupt query answers (nonzero asks operations to stop); may be
 * called from any thread. */
void plano_host_request_interrupt(PlanoHost *host, int32_t value);

/* Progress reports: the last percentage reported (-1 before any), and an optional callback
 * called with each report (set it before starting an operation). */
int32_t plano_host_last_progress(const PlanoHost *host);
void plano_host_set_progress_callback(PlanoHost *host, void (*callback)(void *user, int32_t percentage),
                                      void *user);

/* Counters: threads and semaphores created through this host, and its semaphores not yet
 * destroyed. */
uint32_t plano_host_threads_created(const PlanoHost *host);
uint32_t plano_host_semaphores_created(const PlanoHost *host);
int32_t plano_host_live_semaphores(const PlanoHost *host);

/* Fault injection for tests. After `after` more successful creations every creation fails,
 * until called again; after < 0 never fails. A failing thread creation either returns 0
 * (PLANO_HOST_FAIL_RETURN) or returns success having written identifier -1 without making a
 * thread (PLANO_HOST_FAIL_NEGATIVE_ID). */
#define PLANO_HOST_FAIL_RETURN 0
#define PLANO_HOST_FAIL_NEGATIVE_ID 1
void plano_host_fail_thread_creation(PlanoHost *host, int32_t after, int32_t mode);
void plano_host_fail_semaphore_creation(PlanoHost *host, int32_t after);

#ifdef __cplusplus
}
#endif

#endif
