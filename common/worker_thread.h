// Starting the library's worker threads.
#ifndef COMMON_WORKER_THREAD_H
#define COMMON_WORKER_THREAD_H

#include <pthread.h>

#include <cstddef>

#include "host/timer.h"

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

// Ends one pass of a worker loop. While `idle()` holds (read under `mutex`,
// which guards the command word) a pass would do nothing, so the worker sleeps
// on `wake` until a command is posted and then acts on it at once, on a new
// grid. Otherwise it waits for the next pass.
template <typename Idle>
void EndWorkerPass(pthread_mutex_t* mutex, pthread_cond_t* wake, DelayTimer& pacer, Idle idle) {
    bool waited = false;
    pthread_mutex_lock(mutex);
    while (idle()) {
        pthread_cond_wait(wake, mutex);
        waited = true;
    }
    pthread_mutex_unlock(mutex);
    if (waited) {
        pacer.BeginTiming();
    } else {
        pacer.Delay();
    }
}

#endif  // COMMON_WORKER_THREAD_H
