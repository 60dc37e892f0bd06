// Patrol executor: the worker loop, the choice of the request to serve, and
// the moves of one run.
#include "executor/patrolExecutor.h"

#include <sched.h>
#include <syslog.h>

#include <cstdint>
#include <string>

#include "common/camera_control.h"
#include "common/worker_thread.h"
#include "host/camera.h"

#define EXECUTOR_LOG(fmt, ...)                                                              \
    syslog(LOG_ERR, "%s:%d:%s(): " fmt, "patrolExecutor.cpp", __LINE__, __func__, \
           ##__VA_ARGS__)

namespace {

constexpr int kPassMicros = 250000;  // one pass of the worker loop
constexpr unsigned long long kMicrosPerSecond = 1000000ULL;

bool IsRequestType(PATROL_EXEC_TYPE type) {
    return type == PATROL_EXEC_GUARD || type == PATROL_EXEC_DIRECT;
}

}  // namespace

PatrolExecutor::PatrolExecutor()
    : requestId{0, 0},
      status(PATROL_STATUS_IDLE),
      execType(PATROL_EXEC_NONE),
      command(PATROL_CMD_NONE),
      thread(),
      threadStarted(false),
      progressSeq(0),
      progressRunning(0),
      progressPatrolId(0),
      progressType(PATROL_EXEC_NONE),
      progressCount(0),
      progressIndex(-1),
      progressPosition(0),
      progressRunMoves(0),
      progressMoves(0),
      progressRuns(0) {
    pthread_mutex_init(&mutex, nullptr);
    InitWorkerCond(&wake);
    const int rc = StartWorkerThread(&thread, ThreadFuncExcute, this);
    threadStarted = (rc == 0);
    if (!threadStarted) EXECUTOR_LOG("Create worker thread failed: %d.", rc);
}

PatrolExecutor::~PatrolExecutor() {
    pthread_mutex_lock(&mutex);
    command = PATROL_CMD_EXIT;
    pthread_mutex_unlock(&mutex);
    pthread_cond_signal(&wake);
    if (threadStarted) pthread_join(thread, nullptr);
    DestroyLock(&mutex);
    pthread_cond_destroy(&wake);
}

int PatrolExecutor::Execute(int patrolId, PATROL_EXEC_TYPE type) {
    if (!IsRequestType(type)) return -2;
    pthread_mutex_lock(&mutex);
    command = PATROL_CMD_EXECUTE;
    requestId[type] = patrolId;
    pthread_mutex_unlock(&mutex);
    pthread_cond_signal(&wake);
    return 0;
}

int PatrolExecutor::RemovePatrol(PATROL_EXEC_TYPE type) {
    if (!IsRequestType(type)) return -2;
    pthread_mutex_lock(&mutex);
    command = (type == PATROL_EXEC_GUARD) ? PATROL_CMD_REMOVE_GUARD : PATROL_CMD_REMOVE_DIRECT;
    requestId[type] = 0;
    pthread_mutex_unlock(&mutex);
    pthread_cond_signal(&wake);
    return 0;
}

int PatrolExecutor::GetStatus() { return status.load(); }

// A sequence lock over atomics. The worker (the only writer) makes the counter
// odd, stores the fields with release (so the odd counter is visible before
// any of them) and makes it even again with release. A reader loads the
// counter with acquire, the fields with acquire (so the second load of the
// counter cannot come before them) and the counter again: the same even value
// both times means no write overlapped the copy.
PATROL_RUN_PROGRESS PatrolExecutor::GetRunProgress() const {
    constexpr auto acquire = std::memory_order_acquire;
    PATROL_RUN_PROGRESS p;
    for (unsigned int attempt = 1;; ++attempt) {
        const unsigned int before = progressSeq.load(acquire);
        if ((before & 1u) == 0) {
            p.running = progressRunning.load(acquire);
            p.patrolId = progressPatrolId.load(acquire);
            p.type = static_cast<PATROL_EXEC_TYPE>(progressType.load(acquire));
            p.presetCount = progressCount.load(acquire);
            p.presetIndex = progressIndex.load(acquire);
            p.position = progressPosition.load(acquire);
            p.runMoves = progressRunMoves.load(acquire);
            p.moves = progressMoves.load(acquire);
            p.runs = progressRuns.load(acquire);
            if (progressSeq.load(std::memory_order_relaxed) == before) return p;
        }
        // A write takes a few stores; only a worker preempted in the middle
        // of one keeps a reader here, and then the reader gives way.
        if (attempt % 64 == 0) sched_yield();
    }
}

void* PatrolExecutor::ThreadFuncExcute(void* arg) {
    PatrolExecutor* self = static_cast<PatrolExecutor*>(arg);
    return reinterpret_cast<void*>(static_cast<intptr_t>(self->ExcuteMain()));
}

int PatrolExecutor::DestroyLock(pthread_mutex_t* lock) {
    if (lock == nullptr) return -1;
    if (pthread_mutex_trylock(lock) != 0) pthread_mutex_lock(lock);
    pthread_mutex_unlock(lock);
    pthread_mutex_destroy(lock);
    return 0;
}

// The loop clears a taken command in the same hold of the mutex as it reads
// it (see ExcuteMain), so that a command posted meanwhile is not wiped.
void PatrolExecutor::ResetCommand() {
    pthread_mutex_lock(&mutex);
    command = PATROL_CMD_NONE;
    pthread_mutex_unlock(&mutex);
}

bool PatrolExecutor::ExitPosted() {
    pthread_mutex_lock(&mutex);
    const bool posted = command == PATROL_CMD_EXIT;
    pthread_mutex_unlock(&mutex);
    return posted;
}

void PatrolExecutor::GetExcutePatrolId(int& patrolId, PATROL_EXEC_TYPE& type) {
    pthread_mutex_lock(&mutex);
    if (requestId[PATROL_EXEC_DIRECT] != 0) {
        patrolId = requestId[PATROL_EXEC_DIRECT];
        type = PATROL_EXEC_DIRECT;
    } else if (requestId[PATROL_EXEC_GUARD] != 0) {
        patrolId = requestId[PATROL_EXEC_GUARD];
        type = PATROL_EXEC_GUARD;
    } else {
        patrolId = 0;
        type = PATROL_EXEC_NONE;
    }
    pthread_mutex_unlock(&mutex);
}

void PatrolExecutor::ClearPatrolData(int patrolId, PATROL_EXEC_TYPE type) {
    if (!IsRequestType(type)) return;
    pthread_mutex_lock(&mutex);
    if (requestId[type] == patrolId) requestId[type] = 0;  // a newer request survives
    pthread_mutex_unlock(&mutex);
}

int PatrolExecutor::ChangeExcutePatrol(Patrol& patrol) {
    int result = 0;
    const int currentId = patrol.GetId();
    const PATROL_EXEC_TYPE previousType = execType;
    int patrolId = 0;
    PATROL_EXEC_TYPE type = PATROL_EXEC_NONE;
    GetExcutePatrolId(patrolId, type);

    if (patrolId > 0) {
        // A guard request never displaces a direct run; the same request
        // again leaves its run going.
        const bool behindDirect = status.load() == PATROL_STATUS_RUNNING &&
                                  previousType == PATROL_EXEC_DIRECT && type == PATROL_EXEC_GUARD;
        const bool sameRun = type == previousType && patrolId == currentId;
        if (behindDirect || sameRun) {
            result = 1;
        } else {
            status = PATROL_STATUS_LOADING;
            if (patrol.Load(patrolId) != 0) {
                EXECUTOR_LOG("Load patrol %d failure.", patrolId);
                result = -1;
                // Once an exit is posted no further load begins: the failed
                // direct request is consumed below and the executor is idle.
                if (type == PATROL_EXEC_DIRECT && !ExitPosted()) {
                    ClearPatrolData(patrolId, PATROL_EXEC_DIRECT);
                    // The run in progress was given up when this load began. A
                    // guard request naming it is served like any other: loaded
                    // and started from its first preset, rather than taken for
                    // a run that still goes on.
                    execType = PATROL_EXEC_NONE;
                    return ChangeExcutePatrol(patrol);
                }
            }
        }
        if (result >= 0 && patrol.GetPresetListNum() > 0) {
            if (result == 0) {
                execType = type;
                status = PATROL_STATUS_RUNNING;
                PublishRunStart(patrol, type);
            }
            return result;
        }
    } else {
        result = -1;
    }

    // The request is consumed before the executor shows idle: a guard that
    // sees idle and posts its patrol again must not have that post wiped.
    ClearPatrolData(patrolId, type);
    execType = PATROL_EXEC_NONE;
    status = PATROL_STATUS_IDLE;
    PublishRunEnd();
    return result;
}

int PatrolExecutor::ExcuteMain() {
    WorkerPacer pacer(kPassMicros);
    TimeCount stayCount;
    Patrol loadedPatrol;
    int presetIndex = 0;
    bool tourDone = false;
    pacer.BeginTiming();

    // An exit posted during a load (database and camera calls) or a move is
    // seen before the next of them begins: no move after a load, no load
    // after a run ends.
    //
    // First move of the run that ChangeExcutePatrol has just loaded; a failed
    // move ends the run at once. False when no move was made.
    auto startRun = [&]() {
        if (ExitPosted()) return false;
        InitExecParam(tourDone, presetIndex, stayCount, loadedPatrol.GetStayTime());
        if (ExecPatrol(loadedPatrol, presetIndex, tourDone) == 0) {
            stayCount.BeginCountFromNow();
            return true;
        }
        ExecFinish(loadedPatrol.GetId());
        return false;
    };
    // After a run ended: one attempt at the request that is left, if any.
    auto startNext = [&]() {
        if (!ExitPosted() && ChangeExcutePatrol(loadedPatrol) == 0) startRun();
    };

    for (;;) {
        pthread_mutex_lock(&mutex);
        const int taken = command;
        if (taken == PATROL_CMD_EXECUTE || taken == PATROL_CMD_REMOVE_DIRECT ||
            taken == PATROL_CMD_REMOVE_GUARD) {
            command = PATROL_CMD_NONE;
        }
        pthread_mutex_unlock(&mutex);

        switch (taken) {
            case PATROL_CMD_NONE:
                if (status.load() == PATROL_STATUS_RUNNING && stayCount.IsExceed() != 0) {
                    if (ExecPatrol(loadedPatrol, presetIndex, tourDone) == 0) {
                        stayCount.BeginCountFromNow();
                    } else {
                        ExecFinish(loadedPatrol.GetId());
                        startNext();
                    }
                }
                break;
            case PATROL_CMD_EXIT:
                return 0;
            case PATROL_CMD_EXECUTE:
                if (ChangeExcutePatrol(loadedPatrol) == 0 && !startRun()) startNext();
                break;
            case PATROL_CMD_REMOVE_DIRECT:
                if (execType == PATROL_EXEC_DIRECT) {
                    ExecFinish(loadedPatrol.GetId());
                    startNext();
                }
                break;
            case PATROL_CMD_REMOVE_GUARD:
                if (execType == PATROL_EXEC_GUARD) ExecFinish(loadedPatrol.GetId());
                break;
            default:
                EXECUTOR_LOG("Error command: %d.", taken);
                break;
        }

        EndWorkerPass(
            &mutex, &wake, pacer,
            [this] { return command == PATROL_CMD_NONE && status.load() == PATROL_STATUS_IDLE; },
            [this] { return command == PATROL_CMD_EXIT; });
    }
}

// ---- one run ----

void PatrolExecutor::InitExecParam(bool& tourDone, int& presetIndex, TimeCount& stayCount,
                                   int stayTime) {
    presetIndex = 0;
    tourDone = false;
    // Formed in 64 bits: any int stay time fits; a negative one counts as 0.
    const unsigned long long seconds = stayTime > 0 ? static_cast<unsigned long long>(stayTime) : 0;
    stayCount.SetCountingTime(seconds * kMicrosPerSecond);
}

int PatrolExecutor::ExecPatrol(Patrol& patrol, int& presetIndex, bool& tourDone) {
    Camera camera;
    PRESET_INFO preset{0, std::string()};
    std::string presetName;

    if (patrol.GetPresetListNum() == 0) {
        EXECUTOR_LOG("No preset to execute.");
        return -1;
    }
    if (presetIndex >= patrol.GetPresetListNum()) {
        EXECUTOR_LOG("Parameter error.");
        return -2;
    }
    if (patrol.GetPresetFromList(presetIndex, &preset) != 0) {
        EXECUTOR_LOG("Get preset information failure.");
        return -1;
    }
    if (camera.Load(patrol.GetCamId(), 0) != 0) {
        EXECUTOR_LOG("Get camera info. [%d] failed.", patrol.GetCamId());
        return -1;
    }
    CameraAPI* api = NewCameraAPIFromRecord(camera);
    if (api == nullptr) {
        EXECUTOR_LOG("Get camera API failed.");
        return -1;
    }
    presetName = "kelo" + itos(preset.position);
    if (api->GoPreset(preset.position, presetName) != 0) {
        EXECUTOR_LOG("Go to camera preset failed. Position=%d, Name=%s", preset.position,
                     presetName.c_str());
        releaseCameraAPI(api);
        return -1;
    }
    releaseCameraAPI(api);
    PublishMove(presetIndex, preset.position);

    if (tourDone) return -1;  // the closing move back to the first preset
    ++presetIndex;
    if (presetIndex >= patrol.GetPresetListNum()) {
        presetIndex = 0;
        tourDone = true;
    }
    return 0;
}

// Consumes the request before showing idle, for the reason given in
// ChangeExcutePatrol.
void PatrolExecutor::ExecFinish(int patrolId) {
    ClearPatrolData(patrolId, execType);
    execType = PATROL_EXEC_NONE;
    status = PATROL_STATUS_IDLE;
    PublishRunEnd();
}

// ---- run progress (worker thread only; see GetRunProgress) ----

namespace {

// Makes the counter odd on construction and even again on destruction.
class ProgressWrite {
public:
    explicit ProgressWrite(std::atomic<unsigned int>& seq) : seq_(seq) {
        seq_.store(seq_.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
    }
    ~ProgressWrite() {
        seq_.store(seq_.load(std::memory_order_relaxed) + 1, std::memory_order_release);
    }
    ProgressWrite(const ProgressWrite&) = delete;
    ProgressWrite& operator=(const ProgressWrite&) = delete;

private:
    std::atomic<unsigned int>& seq_;
};

constexpr auto kRelease = std::memory_order_release;

}  // namespace

void PatrolExecutor::PublishRunStart(const Patrol& patrol, PATROL_EXEC_TYPE type) {
    ProgressWrite write(progressSeq);
    progressRunning.store(1, kRelease);
    progressPatrolId.store(patrol.GetId(), kRelease);
    progressType.store(type, kRelease);
    progressCount.store(patrol.GetPresetListNum(), kRelease);
    progressIndex.store(-1, kRelease);
    progressPosition.store(0, kRelease);
    progressRunMoves.store(0, kRelease);
    progressRuns.store(progressRuns.load(std::memory_order_relaxed) + 1, kRelease);
}

void PatrolExecutor::PublishMove(int presetIndex, int position) {
    ProgressWrite write(progressSeq);
    progressIndex.store(presetIndex, kRelease);
    progressPosition.store(position, kRelease);
    progressRunMoves.store(progressRunMoves.load(std::memory_order_relaxed) + 1, kRelease);
    progressMoves.store(progressMoves.load(std::memory_order_relaxed) + 1, kRelease);
}

void PatrolExecutor::PublishRunEnd() {
    if (progressRunning.load(std::memory_order_relaxed) == 0) return;  // nothing to end
    ProgressWrite write(progressSeq);
    progressRunning.store(0, kRelease);
}
