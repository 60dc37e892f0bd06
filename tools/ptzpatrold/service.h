// ptzpatrold: the guards of every scheduled camera, driven by the weekly
// schedules (guard_schedule) and the cameras' events.
//
// Per camera with schedule entries: one PatrolExecutor, its GuardExecutor
// and, for an ONVIF camera, an onvif::EventSource (other cameras have no
// events: both read absent). Once a second the entry in force
// (GuardScheduleAt) and the two event statuses go to AnalyzeSchedule (no
// entry in force: mode OFF, which stops a running guard); between those
// ticks a change of an event (its state or its alarm count) is passed on
// within 100 ms: the sources are read again when the hub counts a change.
// The entry in force is worked out again only when it may have changed.
//
// The guard's repeat count, pause and event validity are fixed when it is
// made. When the entry in force asks for other values the guard is
// replaced: Terminate, RemovePatrol of the guard kind (the guard run in
// progress ends at the executor's next pass; the camera stays at the preset
// it reached), a new guard with the entry's values, which starts idle, so
// the new entry is judged at once, without the 5 s hold-off a change of
// patrol or mode alone brings.
//
// A loader thread polls the tables every `pollSeconds` with one statement
// that returns a digest of the schedule, the scheduled cameras' records and
// the scheduled patrols' cameras; only when it changes are they read and
// applied at the next step (cameras started, stopped, entries replaced, event
// sources made again for a changed camera record). While the database
// cannot be read the last schedule stays in force.
//
// Threads: the owner calls Step, Status, Reload and Stop from any threads
// (one mutex orders them); Status never waits for a camera or the database.
#ifndef TOOLS_PTZPATROLD_SERVICE_H
#define TOOLS_PTZPATROLD_SERVICE_H

#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <nlohmann/json.hpp>
#include <string>
#include <thread>
#include <vector>

#include "executor/guardExecutor.h"
#include "host/camera.h"
#include "hostlib/camera/onvif_events.h"
#include "hostlib/db/guard_schedule.h"

namespace ptzd {

struct Options {
    int pollSeconds = 5;  // how often the tables are looked at
    // Event subscriptions: a long poll of 30 s and 120 s asked for each
    // subscription (renewed at half) keep hundreds of idle cameras to a
    // request every 20 s each (the event sources' defaults, 10 s and 60 s,
    // make twice as many); an event still arrives at once. A camera that
    // vanishes without closing its connection is noticed within 35 s.
    int eventPullSeconds = 30;
    int eventSubscriptionSeconds = 120;
    int eventStopMs = 300;  // bound of a camera's Unsubscribe when stopping
};

// What the loader read: the scheduled cameras with their records and usable
// entries, and why some entries or cameras are left out.
struct Schedule {
    struct Camera {
        CameraSettings record;
        std::vector<GuardScheduleEntry> entries;
        std::string problem;  // entries left out, "" none
    };
    std::map<int, Camera> cameras;
    std::vector<std::string> problems;  // cameras left out
};

// Reads the schedule and what goes with it. 0: read; -1: a statement failed.
int LoadSchedule(Schedule* schedule);

class Service {
public:
    explicit Service(const Options& options);
    ~Service();  // Stop
    Service(const Service&) = delete;
    Service& operator=(const Service&) = delete;

    // Starts the loader thread (the first read at once).
    void Start();
    // One step of the main loop, to be called every 100 ms: applies a new
    // schedule, passes changed events on, and once a second judges every
    // camera's entry in force.
    void Step();
    // Asks the loader to read the tables now (SIGHUP).
    void Reload();
    // The state of every camera, as the status request answers it.
    nlohmann::json Status();
    // Stops the loader, every guard, executor and event source, in parallel
    // where a call may wait; returns when all are gone, or after 900 ms with
    // a camera or database call still in flight, which is left to run
    // (Abandoned): the owner then ends the process without destroying the
    // service. Idempotent.
    void Stop();
    bool Abandoned() const { return abandoned_; }

private:
    struct Camera;
    struct Teardown;

    void LoaderMain();
    void Apply(Schedule& schedule);
    void StartCamera(int id, Schedule::Camera& scheduled, time_t now);
    void Tick(Camera& c, time_t now);
    void Analyze(Camera& c);
    void ReplaceGuard(Camera& c, const GuardScheduleEntry& entry);
    void WatchGuard(Camera& c);
    void WatchEvents(Camera& c);
    void MakeEvents(Camera& c);
    nlohmann::json CameraStatus(const Camera& c);

    Options options_;
    std::unique_ptr<onvif::EventHub> hub_;

    // Cameras and what the last read said. Guarded by mu_ (Step, Status, Stop).
    std::mutex mu_;
    std::map<int, std::unique_ptr<Camera>> cameras_;
    std::vector<std::string> problems_;
    time_t lastTick_ = 0;
    uint64_t eventChanges_ = 0, watchedChanges_ = 0;  // hub_->Changes() as last looked at
    bool stopped_ = false;

    // Between the loader and Step. Guarded by loaderMu_.
    std::mutex loaderMu_;
    std::condition_variable loaderWake_;
    std::unique_ptr<Schedule> fresh_;  // read, not yet applied
    bool reload_ = false, quit_ = false;
    bool loaderDone_ = true;  // no loader running (Start clears it)
    std::string readError_;   // "" while the tables are read
    time_t readAt_ = 0;       // last successful look at the tables
    std::thread loader_;
    bool abandoned_ = false;  // Stop left the loader running (owner thread only)
};

// Local time as ISO 8601 with the zone's offset ("2024-10-27T02:30:00+02:00").
std::string LocalIso(time_t t);
// Logs one line to the system log (ident ptzpatrold).
void Log(int priority, const char* format, ...) __attribute__((format(printf, 2, 3)));

}  // namespace ptzd

#endif  // TOOLS_PTZPATROLD_SERVICE_H
