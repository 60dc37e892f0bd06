// Starting and pacing the library's worker threads.
#ifndef COMMON_WORKER_THREAD_H
#define COMMON_WORKER_THREAD_H

#include <pthread.h>
#include <time.h>

#include <cstddef>
#include <cstdint>

// Stack reserved for each worker thread at most. The default (the stack
// ulimit, often 8 MiB) would make every executor reserve that much address
// space; in a 32-bit host a few hundred workers would exhaust it. The workers
// run database and camera calls (libpq, libcurl, XML parsing), which need far
// less than this.
constexpr size_t kWorkerStackBytes = 1024 * 1024;

// pthread_create with the default attributes, except a stack no larger than
// kWorkerStackBytes. Returns pthread_create's result.
inline int StartWorkerThread(pthread_t* thread, void* (*entry)(void*), void* arg) {
    pthread_attr_t attr;
    if (pthread_attr_init(&attr) != 0) return pthread_create(thread, nullptr, entry, arg);
    size_t stack = 0;
    if (pthread_attr_getstacksize(&attr, &stack) == 0 && stack > kWorkerStackBytes) {
        pthread_attr_setstacksize(&attr, kWorkerStackBytes);
    }
    const int rc = pthread_create(thread, &attr, entry, arg);
    pthread_attr_destroy(&attr);
    return rc;
}

// Makes `wake` a condition variable whose timed waits count on
// CLOCK_MONOTONIC, so changes of the wall clock do not move a worker's
// deadlines. Returns pthread_cond_init's result.
inline int InitWorkerCond(pthread_cond_t* wake) {
    pthread_condattr_t attr;
    if (pthread_condattr_init(&attr) != 0) return pthread_cond_init(wake, nullptr);
    pthread_condattr_setclock(&attr, CLOCK_MONOTONIC);
    const int rc = pthread_cond_init(wake, &attr);
    pthread_condattr_destroy(&attr);
    return rc;
}

// Paces a worker loop: passes start one period apart on a grid of absolute
// deadlines on CLOCK_MONOTONIC, so a pass that takes a while does not shift the
// ones after it; after an overrun of more than a period the grid restarts from
// now instead of firing a burst of passes. The wait is on the worker's own
// condition variable (made by InitWorkerCond), so a posted exit ends it at
// once; a host timer's sleep could not be woken and would hold up shutdown.
// Times are kept in 64-bit microseconds, also where time_t has 32 bits.
class WorkerPacer {
public:
    explicit WorkerPacer(int periodMicroseconds)
        : period_(periodMicroseconds > 0 ? periodMicroseconds : 0), next_(NowMicros()) {}

    // Sets the next deadline one period from now.
    void BeginTiming() { next_ = NowMicros() + period_; }

    // With `mutex` held: waits on `wake` until the next deadline, or less if
    // `stop()` (read under `mutex`) holds or comes to hold. Other signals do
    // not end the wait.
    template <typename Stop>
    void WaitNext(pthread_mutex_t* mutex, pthread_cond_t* wake, Stop stop) {
        const int64_t now = NowMicros();
        if (now - next_ > period_) next_ = now;
        struct timespec deadline;
        deadline.tv_sec = static_cast<time_t>(next_ / 1000000);
        deadline.tv_nsec = static_cast<long>(next_ % 1000000) * 1000;
        next_ += period_;
        while (!stop()) {
            if (pthread_cond_timedwait(wake, mutex, &deadline) != 0) break;  // ETIMEDOUT
        }
    }

private:
    static int64_t NowMicros() {
        struct timespec ts;
        clock_gettime(CLOCK_MONOTONIC, &ts);
        return static_cast<int64_t>(ts.tv_sec) * 1000000 + ts.tv_nsec / 1000;
    }

    int64_t period_;
    int64_t next_;  // monotonic microseconds
};

// Ends one pass of a worker loop. While `idle()` holds (read under `mutex`,
// which guards the command word) a pass would do nothing, so the worker sleeps
// on `wake` until a command is posted and then acts on it at once, on a new
// grid. Otherwise it waits for the next pass, or less once `exitPosted()`
// holds (also read under `mutex`).
template <typename Idle, typename ExitPosted>
void EndWorkerPass(pthread_mutex_t* mutex, pthread_cond_t* wake, WorkerPacer& pacer, Idle idle,
                   ExitPosted exitPosted) {
    bool waited = false;
    pthread_mutex_lock(mutex);
    while (idle()) {
        pthread_cond_wait(wake, mutex);
        waited = true;
    }
    if (waited) {
        pacer.BeginTiming();
    } else {
        pacer.WaitNext(mutex, wake, exitPosted);
    }
    pthread_mutex_unlock(mutex);
}

#endif  // COMMON_WORKER_THREAD_H
