// Guard executor: the decision of AnalyzeSchedule and the guard loop that
// repeats, pauses and holds off guard runs of the bound executor.
#include "executor/guardExecutor.h"

#include <syslog.h>

#include <climits>
#include <cstdint>

#include "common/worker_thread.h"
#include "host/timer.h"

#define GUARD_LOG(fmt, ...) \
    syslog(LOG_ERR, "%s:%d:%s(): " fmt, "guardExecutor.cpp", __LINE__, __func__, ##__VA_ARGS__)

namespace {

constexpr int kPassMicros = 250000;                      // one pass of the guard loop
constexpr unsigned long long kAfterExecuteMicros = 1000000;  // before the executor is asked
constexpr unsigned long long kHoldOffMicros = 5000000;
constexpr unsigned long long kMicrosPerMinute = 60000000ULL;
constexpr long long kMicrosPerSecond = 1000000LL;

}  // namespace

GuardExecutor::GuardExecutor(int guardId)
    : guardId(guardId),
      repeatCount(0),
      pauseMinutes(0),
      eventValidSeconds(0),
      current{0, GUARD_MODE_OFF},
      pending{0, GUARD_MODE_OFF},
      state(GUARD_STATE_IDLE),
      command(GUARD_CMD_NONE),
      executor(nullptr),
      thread(),
      mutex(),
      wake(),
      started(false) {}

GuardExecutor::~GuardExecutor() {
    if (started) Terminate();
}

int GuardExecutor::Init(PatrolExecutor* executor, int repeatCount, int pauseMinutes,
                        int eventValidSeconds) {
    if (executor == nullptr) return -2;
    if (started) return -1;  // a second thread would share this object's state
    this->executor = executor;
    this->repeatCount = repeatCount;
    this->pauseMinutes = pauseMinutes;
    this->eventValidSeconds = eventValidSeconds;
    pthread_mutex_init(&mutex, nullptr);
    InitWorkerCond(&wake);
    started = true;
    const int rc = StartWorkerThread(&thread, ThreadFuncExcute, this);
    if (rc != 0) {
        // Without a thread there is nothing to terminate: report the failure.
        GUARD_LOG("Create guard thread failed: %d.", rc);
        started = false;
        pthread_mutex_destroy(&mutex);
        pthread_cond_destroy(&wake);
        this->executor = nullptr;
        return -1;
    }
    return 0;
}

bool GuardExecutor::IsEventPresent(const EVENT_STATUS& event) const {
    // The span in microseconds, formed in 64 bits and saturated at INT_MAX;
    // a negative validity counts as 0.
    long long span = eventValidSeconds > 0 ? eventValidSeconds * kMicrosPerSecond : 0;
    if (span > INT_MAX) span = INT_MAX;
    return IsTimeStampValid(event.timestamp, static_cast<int>(span)) == 1 && event.active == 1;
}

void GuardExecutor::AnalyzeSchedule(EVENT_STATUS first, EVENT_STATUS second,
                                    GuardScheduleInfo info) {
    if (!started) return;  // no thread and no mutex before Init
    const bool firstPresent = IsEventPresent(first);
    const bool secondPresent = IsEventPresent(second);

    pthread_mutex_lock(&mutex);
    const GuardScheduleInfo inForce = current;
    pthread_mutex_unlock(&mutex);
    const int now = state.load();
    const bool busy = now == GUARD_STATE_RUNNING || now == GUARD_STATE_INTERVAL;
    const bool idle = now == GUARD_STATE_IDLE;

    int decision = GUARD_CMD_NONE;
    if ((info.patrolId != inForce.patrolId || info.mode != inForce.mode) && busy) {
        decision = GUARD_CMD_STOP;  // a new entry first stops the runs of the old one
    } else {
        switch (info.mode) {
            case GUARD_MODE_OFF:
                if (busy) decision = GUARD_CMD_STOP;
                break;
            case GUARD_MODE_CONTINUOUS:
                if (idle) decision = GUARD_CMD_START;
                break;
            case GUARD_MODE_FIRST_EVENT:
                if (idle && firstPresent) decision = GUARD_CMD_START;
                break;
            case GUARD_MODE_SECOND_EVENT:
                if (idle && secondPresent) decision = GUARD_CMD_START;
                break;
            case GUARD_MODE_ANY_EVENT:
                if (idle && (firstPresent || secondPresent)) decision = GUARD_CMD_START;
                break;
            default:
                break;
        }
    }

    bool posted = false;
    pthread_mutex_lock(&mutex);
    pending = info;
    if (command == GUARD_CMD_NONE && decision != GUARD_CMD_NONE) {  // never overwrite a command
        command = decision;
        posted = true;
    }
    pthread_mutex_unlock(&mutex);
    if (posted) pthread_cond_signal(&wake);
}

int GuardExecutor::Terminate() {
    if (!started) return -1;
    pthread_mutex_lock(&mutex);
    command = GUARD_CMD_TERMINATE;
    pthread_mutex_unlock(&mutex);
    pthread_cond_signal(&wake);
    pthread_join(thread, nullptr);
    DestroyLock(&mutex);
    pthread_cond_destroy(&wake);
    started = false;
    return 0;
}

void* GuardExecutor::ThreadFuncExcute(void* arg) {
    GuardExecutor* self = static_cast<GuardExecutor*>(arg);
    return reinterpret_cast<void*>(static_cast<intptr_t>(self->ExcuteMain()));
}

int GuardExecutor::DestroyLock(pthread_mutex_t* lock) {
    if (lock == nullptr) return -1;
    if (pthread_mutex_trylock(lock) != 0) pthread_mutex_lock(lock);
    pthread_mutex_unlock(lock);
    pthread_mutex_destroy(lock);
    return 0;
}

int GuardExecutor::ExcuteMain() {
    WorkerPacer pacer(kPassMicros);
    TimeCount guardTimer;
    int runCount = 0;
    pacer.BeginTiming();

    const auto startTimer = [&guardTimer](unsigned long long micros) {
        guardTimer.SetCountingTime(micros);
        guardTimer.BeginCountFromNow();
    };
    // Clears a handled START or STOP; a TERMINATE posted meanwhile stays.
    const auto clearTaken = [this](int taken) {
        pthread_mutex_lock(&mutex);
        if (command == taken) command = GUARD_CMD_NONE;
        pthread_mutex_unlock(&mutex);
    };

    for (;;) {
        pthread_mutex_lock(&mutex);
        const int taken = command;
        if (taken == GUARD_CMD_START) current = pending;
        pthread_mutex_unlock(&mutex);

        switch (taken) {
            case GUARD_CMD_TERMINATE:
                return 0;
            case GUARD_CMD_START:
                runCount = 1;
                executor->Execute(current.patrolId, PATROL_EXEC_GUARD);
                state = GUARD_STATE_RUNNING;
                startTimer(kAfterExecuteMicros);
                clearTaken(taken);
                break;
            case GUARD_CMD_STOP:
                executor->RemovePatrol(PATROL_EXEC_GUARD);
                state = GUARD_STATE_HOLDOFF;
                startTimer(kHoldOffMicros);
                clearTaken(taken);
                break;
            case GUARD_CMD_NONE:
                if (guardTimer.IsExceed() == 0) break;
                switch (state.load()) {
                    case GUARD_STATE_RUNNING:
                        if (executor->GetStatus() != PATROL_STATUS_IDLE) break;
                        if (repeatCount <= 0 || runCount < repeatCount) {
                            // Without end, the count stops short of overflowing.
                            if (runCount < INT_MAX) ++runCount;
                            executor->Execute(current.patrolId, PATROL_EXEC_GUARD);
                            startTimer(kAfterExecuteMicros);
                        } else if (current.mode == GUARD_MODE_CONTINUOUS) {
                            state = GUARD_STATE_INTERVAL;
                            const unsigned long long minutes =
                                pauseMinutes > 0 ? static_cast<unsigned long long>(pauseMinutes)
                                                 : 0;
                            startTimer(minutes * kMicrosPerMinute);
                        } else if (current.mode != GUARD_MODE_OFF) {
                            state = GUARD_STATE_HOLDOFF;
                            startTimer(kHoldOffMicros);
                        }
                        break;
                    case GUARD_STATE_INTERVAL:
                    case GUARD_STATE_HOLDOFF:
                        state = GUARD_STATE_IDLE;
                        break;
                    default:
                        break;
                }
                break;
            default:
                GUARD_LOG("Error command: %d.", taken);
                break;
        }

        EndWorkerPass(
            &mutex, &wake, pacer,
            [this] { return command == GUARD_CMD_NONE && state.load() == GUARD_STATE_IDLE; },
            [this] { return command == GUARD_CMD_TERMINATE; });
    }
}
