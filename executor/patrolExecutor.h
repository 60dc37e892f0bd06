// Runs stored patrols on a camera: one worker thread per executor, two request
// slots (guard and direct, direct first), one run at a time.
#ifndef EXECUTOR_PATROLEXECUTOR_H
#define EXECUTOR_PATROLEXECUTOR_H

#include <pthread.h>

#include <atomic>

#include "common/export.h"
#include "host/timer.h"
#include "patrol/patrol.h"

// Who asked for a run. Indexes the request slots; NONE is only ever an output.
typedef enum __tag_PATROL_EXEC_TYPE {
    PATROL_EXEC_GUARD = 0,   // posted through a GuardExecutor
    PATROL_EXEC_DIRECT = 1,  // posted by the host; takes precedence over GUARD
    PATROL_EXEC_NONE = 2     // no run, no request
} PATROL_EXEC_TYPE;

// What GetStatus reports.
enum {
    PATROL_STATUS_IDLE = 0,     // no run
    PATROL_STATUS_LOADING = 1,  // a requested patrol is being loaded
    PATROL_STATUS_RUNNING = 2   // a patrol with at least one preset is being run
};

// The one-word command mailbox; a newer command replaces one not yet taken.
enum {
    PATROL_CMD_NONE = 0,
    PATROL_CMD_EXIT = 1,
    PATROL_CMD_EXECUTE = 2,
    PATROL_CMD_REMOVE_DIRECT = 3,
    PATROL_CMD_REMOVE_GUARD = 4
};

// The run of an executor, as GetRunProgress copies it out: one consistent
// snapshot, written only by the worker at the start of a run, at each move the
// camera accepted and at the end of a run.
typedef struct __tag_PATROL_RUN_PROGRESS {
    // 1 while a run is in progress (status RUNNING), else 0. The fields below
    // then describe the run that ended last, as it ended (all 0, presetIndex
    // -1 and type NONE before the first run).
    int running;
    int patrolId;           // patrol of the run
    PATROL_EXEC_TYPE type;  // who asked for it: GUARD or DIRECT
    int presetCount;        // presets of the run's patrol
    // Index (0-based, < presetCount) of the preset the camera was last sent to
    // in this run: the one it stays at. -1 until the run's first move. The
    // closing move of a tour goes back to index 0.
    int presetIndex;
    int position;  // the camera's preset number of presetIndex; 0 while it is -1
    // Moves the camera accepted in this run: 0 at its start, presetCount + 1
    // once the tour closed. The k-th move of a run goes to index k - 1, the
    // last (k = presetCount + 1) back to index 0: with `moves` a poller that
    // missed some can tell which they were.
    int runMoves;
    // Moves the camera accepted on this executor since it was constructed,
    // closing moves included. Monotonic (wraps at 2^32): a poller that sees it
    // change by one has seen every move.
    unsigned int moves;
    // Runs started on this executor since it was constructed, monotonic: a
    // new run of the same patrol (a guard repeat, or a guard run started again
    // after a direct one) shows as a change here.
    unsigned int runs;
} PATROL_RUN_PROGRESS;

// Runs at most one patrol at a time on its own worker thread. While a run is
// in progress the worker makes one pass every 250 ms; an idle worker sleeps
// until a command is posted and acts on it at once. A pass takes the command,
// loads the requested patrol, and sends the camera from preset to preset
// ("kelo<position>"), waiting the patrol's stay time at each, then back to
// the first preset, and the run ends.
//
// Thread-safety: Execute, RemovePatrol and GetStatus may be called from any
// thread; none of them waits for the worker. The destructor posts EXIT and
// joins the worker; nobody may post to the executor once it has begun.
class PTZ_EXPORT PatrolExecutor {
public:
    // Starts the worker thread. If the thread cannot be created (logged), the
    // executor stays idle and accepts requests that nothing serves.
    PatrolExecutor();
    // Stops and joins the worker: at once between passes and during a stay;
    // else as soon as the load of a patrol or the move in progress returns
    // (no further load or move is begun).
    ~PatrolExecutor();
    PatrolExecutor(const PatrolExecutor&) = delete;
    PatrolExecutor& operator=(const PatrolExecutor&) = delete;

    // Asks for patrol `patrolId` to be run for requester `type`; served at the
    // worker's next pass. A slot holding 0 or a negative id means nothing to
    // run. 0: posted; -2: `type` is neither GUARD nor DIRECT (nothing posted).
    int Execute(int patrolId, PATROL_EXEC_TYPE type);
    // Withdraws the request of `type`; ends its run if it is the one running.
    // 0: posted; -2: `type` is neither GUARD nor DIRECT (nothing posted).
    int RemovePatrol(PATROL_EXEC_TYPE type);
    // PATROL_STATUS_IDLE, _LOADING or _RUNNING.
    int GetStatus();
    // The run in progress (or the last one), copied out as one consistent
    // snapshot. Never waits for the worker: it reads atomics and retries only
    // while the worker is in the middle of its few stores. Any thread. A run
    // displaced by another request is shown until the new run starts.
    PATROL_RUN_PROGRESS GetRunProgress() const;

private:
    static void* ThreadFuncExcute(void* arg);
    // The worker loop; 0 when it leaves on EXIT.
    int ExcuteMain();
    // Takes the mutex (waiting for a holder), then unlocks and destroys it.
    // -1 for null, else 0.
    int DestroyLock(pthread_mutex_t* lock);
    void ResetCommand();
    // Whether the destructor has posted EXIT (read under mutex).
    bool ExitPosted();
    // The request to serve: direct first, then guard, else (0, NONE).
    void GetExcutePatrolId(int& patrolId, PATROL_EXEC_TYPE& type);
    // Empties the slot of `type` if it still holds `patrolId`.
    void ClearPatrolData(int patrolId, PATROL_EXEC_TYPE type);
    // Picks the request to serve and loads it into `patrol`. 0: a new run is
    // loaded; 1: the run in progress stays; -1: nothing to run, or the load failed.
    int ChangeExcutePatrol(Patrol& patrol);

    // One run (worker thread only).
    void InitExecParam(bool& tourDone, int& presetIndex, TimeCount& stayCount, int stayTime);
    // One move. 0: moved and advanced; -1: failed or the tour's closing move;
    // -2: presetIndex out of range.
    int ExecPatrol(Patrol& patrol, int& presetIndex, bool& tourDone);
    void ExecFinish(int patrolId);
    // Writes the run progress (worker thread only): a new run, a move, or the end.
    void PublishRunStart(const Patrol& patrol, PATROL_EXEC_TYPE type);
    void PublishMove(int presetIndex, int position);
    void PublishRunEnd();

    // Request slots, indexed by GUARD and DIRECT; 0 means none. Guarded by mutex.
    int requestId[2];
    // Written by the worker only (and the constructor); read by any thread.
    std::atomic<int> status;
    // Kind of the run in progress, NONE when idle. Worker thread only.
    PATROL_EXEC_TYPE execType;
    // The command word. Guarded by mutex.
    int command;
    pthread_t thread;
    // Guards requestId and command only; held for a few stores, nothing is
    // called while it is held.
    pthread_mutex_t mutex;
    // Signalled after each post; an idle worker with no command sleeps on it
    // (with mutex) instead of making empty passes, and a running one waits on
    // it for its next pass, so that EXIT wakes it. Times on CLOCK_MONOTONIC.
    pthread_cond_t wake;
    // Whether pthread_create succeeded (the destructor joins only a started
    // worker). Set by the constructor only.
    bool threadStarted;
    // Run progress: a sequence counter (odd while the worker writes) over
    // atomic fields, written by the worker only, read by GetRunProgress.
    std::atomic<unsigned int> progressSeq;
    std::atomic<int> progressRunning, progressPatrolId, progressType, progressCount;
    std::atomic<int> progressIndex, progressPosition, progressRunMoves;
    std::atomic<unsigned int> progressMoves, progressRuns;
};

#endif  // EXECUTOR_PATROLEXECUTOR_H
