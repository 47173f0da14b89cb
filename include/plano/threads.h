/* The host's thread table, threaded workers, the worker pool and threaded smoothing.
 *
 * The engine never creates a thread or a semaphore itself: every threaded operation receives
 * a ThreadHostInterface from its caller and does all thread and semaphore work through it.
 * A ThreadedWorker is one long-lived host thread that waits for a job, runs it, records a
 * status and waits for the next job. The pool is a process-wide set of workers handed out to
 * jobs and reused once a job has been waited for; the processor semaphore bounds how many
 * jobs run at once across all workers. The pool and the processor semaphore are the only
 * global state; the pool must be driven from one controlling thread at a time, and job
 * functions must not call into it.
 *
 * Status values of a worker:
 *   0           a job has been started and has not completed
 *   100         the last job completed and its function returned success
 *   101         an exception escaped the last job; the worker is idle and reusable
 *   102         a semaphore operation of uiThreadedWorkerGetStatus failed (returned, not stored)
 *   103         the last job's function returned failure; the worker is idle and reusable
 *   0xFFFFFFFF  uiThreadedWorkerGetStatus of a null worker
 * A failed job (101 or 103) releases the processor, completion and idle semaphores exactly as
 * a successful one, and its thread stays alive for the next job, so a waiter never blocks.
 * The failed job's error records are kept in the worker and handed to the thread that waits
 * for it (see gbThreadedWorkerPoolWaitUntilCompleted). */
#ifndef PLANO_THREADS_H
#define PLANO_THREADS_H

#include "pellux/image.h"
#include "plano/plano_base.h"

#ifdef __cplusplus
extern "C" {
#endif

struct ThreadHostInterface;
struct StatusTime;

/* Slot 1: progress of a long operation, as a percentage. */
typedef void (*ThreadProgressFunction)(void *callback_context, int32_t percentage);
/* Slot 2: nonzero asks the running operation to stop early (not a failure). */
typedef int32_t (*ThreadInterruptFunction)(void *callback_context);
/* Slot 6: the tracker's coarse correlation, called with the arguments of
 * pgiTrackImageCorrelate2D_q instead of it, and expected to give the same result. */
typedef Plx_Image *(*ThreadCorrelationFunction)(const struct ThreadHostInterface *host,
                                                const Plx_Image *template_image,
                                                const Plx_Image *template_weight,
                                                const Plx_Image *search_image,
                                                const Plx_Image *search_mask,
                                                double texture_threshold, Plx_Image *result,
                                                struct StatusTime *status_time, double time_share);
/* Start routine of a host thread: 0 when its run ended normally, 0xFFFFFFFF on failure. */
typedef uint32_t (*ThreadStartRoutine)(void *start_block);
/* Slot 8: creates a thread running routine(start_block); the engine passes 2, 0, 0 as the
 * extra arguments. Returns nonzero on success, having written an identifier of 0 or more. */
typedef int32_t (*ThreadCreateFunction)(void *thread_context, int32_t *thread_id,
                                        ThreadStartRoutine routine, void *start_block,
                                        int32_t extra1, int32_t extra2, int32_t extra3);
/* Slot 9: joins and forgets a thread once it has been told to end (-1: none was created). */
typedef void (*ThreadCloseFunction)(void *thread_context, int32_t thread_id);
/* Slot 11: creates a counting semaphore into *handle; the engine passes 0 as last argument. */
typedef int32_t (*SemaphoreCreateFunction)(void *semaphore_context, void **handle,
                                           uint32_t initial_count, uint32_t maximum_count,
                                           int32_t extra);
/* Slots 12 and 13: wait (block until the count is above zero, then decrement) and release
 * (increment, waking one waiter). Nonzero on success; a release beyond the maximum fails.
 * A null handle (the processor semaphore before it is initialised) must succeed at once. */
typedef int32_t (*SemaphoreWaitFunction)(void *semaphore_context, void *handle);
typedef int32_t (*SemaphoreReleaseFunction)(void *semaphore_context, void *handle);
/* Slot 14. */
typedef void (*SemaphoreDestroyFunction)(void *semaphore_context, void *handle);
/* Slot 16: the number of jobs a threaded operation should split its work into. */
typedef uint32_t (*ThreadCountFunction)(void *thread_count_context);

/* The host's table: 18 pointer-sized slots, in this order. The engine copies the whole table
 * into each worker it forms or starts, so the host's copy need only live during the call. */
typedef struct ThreadHostInterface {
    void *callback_context;                      /* 0: first argument of slots 1 and 2 */
    ThreadProgressFunction progress;             /* 1: may be null */
    ThreadInterruptFunction interrupt;           /* 2: may be null */
    void *unused3;                               /* 3 */
    void *unused4;                               /* 4 */
    void *unused5;                               /* 5 */
    ThreadCorrelationFunction correlation;       /* 6: may be null */
    void *unused7;                               /* 7 */
    ThreadCreateFunction create_thread;          /* 8 */
    ThreadCloseFunction close_thread;            /* 9 */
    void *thread_context;                        /* 10: first argument of slots 8 and 9 */
    SemaphoreCreateFunction create_semaphore;    /* 11 */
    SemaphoreWaitFunction wait_semaphore;        /* 12 */
    SemaphoreReleaseFunction release_semaphore;  /* 13 */
    SemaphoreDestroyFunction destroy_semaphore;  /* 14 */
    void *semaphore_context;                     /* 15: first argument of slots 11 to 14 */
    ThreadCountFunction thread_count;            /* 16 */
    void *thread_count_context;                  /* 17: the argument of slot 16 */
} ThreadHostInterface;

/* Status values (see the top of this header). */
#define THREADED_WORKER_RUNNING 0u
#define THREADED_WORKER_COMPLETED 100u
#define THREADED_WORKER_EXCEPTION 101u
#define THREADED_WORKER_SEMAPHORE_FAILED 102u
#define THREADED_WORKER_JOB_FAILED 103u
#define THREADED_WORKER_NULL 0xFFFFFFFFu

/* Error records of a failed job kept for its waiter, origin first; further ones are dropped. */
#define THREADED_WORKER_ERROR_RECORDS 16

/* A job: takes its argument, returns 1 on success and 0 on failure. */
typedef Plx_Bool (*ThreadedJobFunction)(void *argument);

struct ThreadedWorker;

/* What the worker's thread is started with. */
typedef struct ThreadedWorkerStartBlock {
    struct ThreadedWorker *worker;
    ThreadedJobFunction job;
    void *argument;
    uint32_t persistent;
} ThreadedWorkerStartBlock;

typedef struct ThreadedWorker {
    uint32_t persistent;               /* 1 once formed: the thread loops over jobs */
    void *start_semaphore;             /* (0, 1): released once per job to wake the thread */
    void *idle_semaphore;              /* (1, 1): held while a job is outstanding */
    void *status_lock;                 /* (1, 1): guards status and the kept error records */
    void *completion_semaphore;        /* (1, 100): released each time a job completes */
    void *spare_semaphore;             /* (1, 1): created and destroyed, not otherwise used */
    int32_t thread_id;                 /* -1 until the host thread exists */
    uint32_t status;
    uint32_t stop;                     /* set by vThreadedWorkerFree */
    uint32_t abort_requested;          /* set by vThreadedWorkerAbort, read back for the host */
    ThreadHostInterface host;          /* the worker's copy of the host table */
    ThreadedWorkerStartBlock start_block;
    uint32_t owned;                    /* 1: allocated by pstctThreadedWorkerAlloc */
    /* Private: the error records of the last failed job, for its waiter. */
    uint32_t error_count;
    Plx_ErrorRecord errors[THREADED_WORKER_ERROR_RECORDS];
} ThreadedWorker;

/* Fills a worker record: five semaphores, the host table copied, no thread yet. Null record:
 * null with nothing registered. A semaphore that cannot be created: code 37 (the ones made
 * before it are destroyed again). A null table or one lacking a thread or semaphore
 * function: code 32. */
PLANO_API ThreadedWorker *pstctThreadedWorkerForm(ThreadedWorker *worker,
                                                  const ThreadHostInterface *host);
/* A heap-allocated worker (owned flag 1), released by vThreadedWorkerFree. */
PLANO_API ThreadedWorker *pstctThreadedWorkerAlloc(const ThreadHostInterface *host);
/* Starts job(argument) on the worker, blocking until its previous job has completed. The
 * host thread is created at the first start and reused afterwards. host null: keep the
 * worker's copy. Null worker: 0 with nothing registered. Thread creation returning 0 gives
 * code 1, a negative identifier code 37; either way the worker stays idle and usable. */
PLANO_API Plx_Bool gbThreadedWorkerStart(ThreadedWorker *worker, ThreadedJobFunction job,
                                         void *argument, const ThreadHostInterface *host);
/* The worker's status; with wait nonzero, first waits for a completion signal. Callers loop
 * until the status is 100 or more: the completion count is only a wake-up signal. */
PLANO_API uint32_t uiThreadedWorkerGetStatus(ThreadedWorker *worker, int32_t wait);
/* Sets the abort-requested flag (read back by the host; no engine job reads it); 1, or 0 for
 * a null worker. */
PLANO_API int32_t vThreadedWorkerAbort(ThreadedWorker *worker);
PLANO_API Plx_Bool gbThreadedWorkerAbortRequested(const ThreadedWorker *worker);
/* Waits for the outstanding job, ends the thread, destroys the semaphores and releases the
 * record when owned. */
PLANO_API void vThreadedWorkerFree(ThreadedWorker *worker);

/* The worker thread's start routine (given to slot 8): runs gbThreadedWorkerInternalRun on
 * the start block's worker; 0 when it ended normally, 0xFFFFFFFF for a null start block. */
PLANO_API uint32_t gbInit(void *start_block);
/* The worker's job loop; returns 1 when told to stop. Never returns on a job's failure: it
 * records the status (101 or 103) and the job's error records and waits for the next job. */
PLANO_API Plx_Bool gbThreadedWorkerInternalRun(ThreadedWorker *worker);

/* Creates the process-wide processor semaphore with initial and maximum count both equal to
 * count; does nothing when it already exists. Only hosts call these two. */
PLANO_API void vThreadedWorkerInitialiseProcessorSemaphore(const ThreadHostInterface *host,
                                                           uint32_t count);
PLANO_API void vThreadedWorkerDestroyProcessorSemaphore(const ThreadHostInterface *host);

/* Starts a job on the first idle pooled worker, forming a new one when none is idle; the
 * pool grows by blocks of 10 workers. Null on failure; a pooled worker whose start failed is
 * freed at once and its slot marked vacant (busy flag 2), so later scans never hand it out
 * and a later pool start forms a fresh worker there. */
PLANO_API ThreadedWorker *pThreadedWorkerPoolStart(ThreadedJobFunction job, void *argument,
                                                   const ThreadHostInterface *host);
/* Waits until the pooled worker's job has completed and makes the worker available again.
 * 1 only for status 100. Otherwise the trace is cleared, the failed job's own records are
 * registered (origin first) and a code-1 record with the status as number is added, so the
 * trace reads from the job's origin outwards. A worker not in the pool (or null): code 1. */
PLANO_API Plx_Bool gbThreadedWorkerPoolWaitUntilCompleted(ThreadedWorker *worker);
PLANO_API uint32_t uiThreadedWorkerPoolGetStatus(ThreadedWorker *worker, int32_t wait);
PLANO_API int32_t vThreadedWorkerPoolAbort(ThreadedWorker *worker);
PLANO_API Plx_Bool gbThreadedWorkerPoolAbortRequested(const ThreadedWorker *worker);
/* Frees every pooled worker (waiting for outstanding jobs) and empties the pool. */
PLANO_API void vThreadedWorkerPoolFree(void);

/* One band of a threaded smoothing pass. */
typedef struct SmoothingJob {
    const ThreadHostInterface *host;  /* interrupt query checked after each chunk; may be null */
    const Plx_Image *source;
    Plx_Image *dest;
    uint32_t direction;               /* 1: along x over a band of rows; 0: along y, columns */
    const Plx_Mask1D *mask;
    uint32_t first;                   /* first row (direction 1) or column (direction 0) */
    uint32_t count;                   /* rows or columns of the band */
} SmoothingJob;

/* Job function of threaded smoothing: convolves its band in chunks of max(count/20, 10) rows
 * or columns with replicated edges; a nonzero interrupt answer after a chunk ends the job at
 * once with success. */
PLANO_API Plx_Bool gbApplySmoothingToWindow(void *job);

/* Gaussian smoothing with 2*trunc(4 sigma)+1 taps, along x into intermediate then along y
 * into dest, split into the host's number of jobs: job 0 runs on the calling thread while
 * the others run on pooled workers (all jobs run on the calling thread when host is null).
 * Float and double images take both directions in one pass over bands of rows, with the
 * x-smoothed rows kept in cache (and still written to intermediate); the bits are those of
 * two separate passes. Results are the same bits for any number of jobs. dest and
 * intermediate are (re)formed with source's format, type and size; dest null makes a new
 * image, intermediate null a temporary one; dest may be source
 * itself (in-place), but intermediate must share pixels with neither (code 7). Returns dest.
 * When a start or a wait fails, every job already started is still waited for before the
 * failure is returned, so no job outlives the images. An interrupt (slot 2) is not a failure:
 * dest is returned with only part of the image smoothed. */
PLANO_API Plx_Image *pgiThreadedSmoothImage(const ThreadHostInterface *host,
                                            const Plx_Image *source, Plx_Image *dest,
                                            double sigma, Plx_Image *intermediate);

#ifdef __cplusplus
}
#endif

#endif
