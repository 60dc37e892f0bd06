// Guard executor: starts and stops guard runs of a PatrolExecutor from a
// schedule entry and the status of two events.
#ifndef EXECUTOR_GUARDEXECUTOR_H
#define EXECUTOR_GUARDEXECUTOR_H

#include <pthread.h>
#include <sys/time.h>

#include <atomic>

#include "common/export.h"
#include "common/ptzpatrol_config.h"  // time_t: the library's width
#include "executor/patrolExecutor.h"

// The schedule entry in force: which patrol, in which mode.
typedef struct _tag_GuardScheduleInfo {
    int patrolId;
    int mode;  // GUARD_MODE_*
} GuardScheduleInfo;

// The host's status of one event.
typedef struct __tag_EVENT_STATUS {
    unsigned char active;      // 1: the event is present
    int reserved;              // the host's own; not read by the guard
    struct timeval timestamp;  // wall-clock time of the status
} EVENT_STATUS;

// Modes of a schedule entry.
enum {
    GUARD_MODE_OFF = 0,           // never start; stop a running guard
    GUARD_MODE_CONTINUOUS = 1,    // start whenever idle; pause after the runs
    GUARD_MODE_FIRST_EVENT = 2,   // start when idle and the first event is present
    GUARD_MODE_SECOND_EVENT = 3,  // start when idle and the second event is present
    GUARD_MODE_ANY_EVENT = 4      // start when idle and either event is present
};

// Guard states.
enum {
    GUARD_STATE_IDLE = 0,      // a start may be decided
    GUARD_STATE_RUNNING = 1,   // runs are being requested
    GUARD_STATE_INTERVAL = 2,  // pause after the runs (continuous mode)
    GUARD_STATE_HOLDOFF = 3    // 5 s wait after a stop or after the runs (event modes)
};

// Guard command word (one slot).
enum { GUARD_CMD_NONE = 0, GUARD_CMD_START = 1, GUARD_CMD_STOP = 2, GUARD_CMD_TERMINATE = 3 };

// Drives a bound PatrolExecutor with guard requests from its own thread, which
// makes one pass every 250 ms unless it is idle (then it sleeps until a
// command is posted). It never talks to a camera.
//
// Lifecycle: construct, Init (starts the thread), AnalyzeSchedule as often as
// wanted from any thread, Terminate (joins the thread). The executor is not
// owned and must outlive Terminate.
class PTZ_EXPORT GuardExecutor {
public:
    explicit GuardExecutor(int guardId);
    // Terminates the thread if the host has not done so; the bound executor
    // must still exist then.
    ~GuardExecutor();
    GuardExecutor(const GuardExecutor&) = delete;
    GuardExecutor& operator=(const GuardExecutor&) = delete;

    // Binds the executor and starts the guard thread. `repeatCount`: runs per
    // start (0 or less: without end); `pauseMinutes`: the pause after the runs
    // in continuous mode; `eventValidSeconds`: how old an event's timestamp may
    // be (negative values count as 0). 0: started; -2: null executor (no
    // thread); -1: already started, or the thread could not be created (logged).
    int Init(PatrolExecutor* executor, int repeatCount, int pauseMinutes, int eventValidSeconds);
    // Judges the schedule entry in force and the two events, and posts START
    // or STOP when the command slot is empty.
    void AnalyzeSchedule(EVENT_STATUS first, EVENT_STATUS second, GuardScheduleInfo info);
    // Ends and joins the guard thread at once (also during a pause or
    // hold-off); a tour in progress on the executor runs on. 0: done; -1: the
    // thread was not running.
    int Terminate();
    // The guard's state (GUARD_STATE_*), read without waiting for the guard
    // thread. Any thread.
    int GetState() const { return state.load(); }

private:
    friend struct GuardExecutorPeer;  // unit tests read the state through it

    static void* ThreadFuncExcute(void* arg);
    int ExcuteMain();
    int DestroyLock(pthread_mutex_t* lock);
    // Whether an event counts as present: active and its timestamp valid.
    bool IsEventPresent(const EVENT_STATUS& event) const;

    int guardId;            // kept for the host; not read
    int repeatCount;        // set by Init
    int pauseMinutes;       // set by Init
    int eventValidSeconds;  // set by Init
    // Entry of the runs being made. Written by the guard thread under mutex
    // (when it takes a START); read by AnalyzeSchedule under mutex.
    GuardScheduleInfo current;
    // Latest entry given to AnalyzeSchedule. Guarded by mutex.
    GuardScheduleInfo pending;
    // Written by the guard thread only; read by AnalyzeSchedule.
    std::atomic<int> state;
    // The command word. Guarded by mutex.
    int command;
    PatrolExecutor* executor;  // not owned; set by Init
    pthread_t thread;
    // Guards pending, command and current's writes; held for a few stores,
    // nothing called inside, never nested with the executor's mutex.
    pthread_mutex_t mutex;
    // Signalled after each post; the thread, idle with no command, sleeps on
    // it (with mutex) instead of making empty passes, and otherwise waits on it
    // for its next pass, so that TERMINATE wakes it. Times on CLOCK_MONOTONIC.
    pthread_cond_t wake;
    bool started;  // Init started the thread and Terminate has not joined it (host threads)
};

#endif  // EXECUTOR_GUARDEXECUTOR_H
