// ptzpatrold: cameras, their guards and events, the schedule loader (see service.h).
#include "service.h"

#include <stdarg.h>
#include <strings.h>
#include <sys/time.h>
#include <syslog.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>

#include "executor/patrolExecutor.h"
#include "host/database.h"
#include "host/timer.h"
#include "hostlib/db/database_config.h"

namespace ptzd {

using nlohmann::json;

namespace {

const char* const kStateNames[] = {"idle", "running", "interval", "holdoff"};
// Stop gives the guards, executors, event sources and the loader this long.
constexpr auto kStopBound = std::chrono::milliseconds(900);

const char* StateName(int state) { return state >= 0 && state < 4 ? kStateNames[state] : "?"; }

int64_t WallMicros() {
    struct timeval tv;
    gettimeofday(&tv, nullptr);
    return static_cast<int64_t>(tv.tv_sec) * 1000000 + tv.tv_usec;
}

bool IsOnvif(const CameraSettings& s) { return strcasecmp(s.vendor.c_str(), "onvif") == 0; }

// What the event source depends on.
bool SameEndpoint(const CameraSettings& a, const CameraSettings& b) {
    return IsOnvif(a) == IsOnvif(b) && a.host == b.host && a.port == b.port &&
           a.username == b.username && a.password == b.password;
}

json IsoOrNull(int64_t micros) {
    return micros > 0 ? json(LocalIso(static_cast<time_t>(micros / 1000000))) : json(nullptr);
}

}  // namespace

void Log(int priority, const char* format, ...) {
    va_list args;
    va_start(args, format);
    vsyslog(priority, format, args);
    va_end(args);
}

std::string LocalIso(time_t t) {
    struct tm tm;
    if (localtime_r(&t, &tm) == nullptr) return "";
    char text[64];
    strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%S%z", &tm);
    std::string iso = text;
    if (iso.size() > 5) iso.insert(iso.size() - 2, ":");  // +0200 -> +02:00
    return iso;
}

int LoadSchedule(Schedule* schedule) {
    std::vector<GuardScheduleEntry> entries;
    std::vector<std::vector<std::string>> cameras, patrols;
    if (GuardScheduleLoad(0, &entries) != 0 ||
        !HostDBQuery("SELECT id, host, port, username, password, vendor, model, channel FROM camera "
              "WHERE id IN (SELECT camId FROM guard_schedule);",
              {"id", "host", "port", "username", "password", "vendor", "model", "channel"},
              &cameras) ||
        !HostDBQuery("SELECT id, camId FROM patrol WHERE id IN (SELECT patrolId FROM guard_schedule);",
              {"id", "camId"}, &patrols))
        return -1;
    std::map<int, CameraSettings> records;
    for (const auto& r : cameras) {
        CameraSettings s;
        s.id = atoi(r[0].c_str());
        s.host = r[1];
        s.port = atoi(r[2].c_str());
        s.username = r[3];
        s.password = r[4];
        s.vendor = r[5];
        s.model = r[6];
        s.channel = r[7];
        records[s.id] = s;
    }
    std::map<int, int> patrolCamera;
    for (const auto& r : patrols) patrolCamera[atoi(r[0].c_str())] = atoi(r[1].c_str());

    schedule->cameras.clear();
    schedule->problems.clear();
    for (const GuardScheduleEntry& e : entries) {
        auto record = records.find(e.camId);
        if (record == records.end()) {
            const std::string p = "camera " + std::to_string(e.camId) + " has no camera record";
            if (std::find(schedule->problems.begin(), schedule->problems.end(), p) ==
                schedule->problems.end())
                schedule->problems.push_back(p);
            continue;
        }
        Schedule::Camera& c = schedule->cameras[e.camId];
        c.record = record->second;
        auto owner = patrolCamera.find(e.patrolId);
        if (owner == patrolCamera.end() || owner->second != e.camId) {
            // The executor would move the patrol's own camera: never another's.
            if (!c.problem.empty()) c.problem += "; ";
            c.problem += "entry " + std::to_string(e.id) + " left out: " +
                         (owner == patrolCamera.end()
                              ? "no patrol " + std::to_string(e.patrolId)
                              : "patrol " + std::to_string(e.patrolId) + " is of camera " +
                                    std::to_string(owner->second));
            continue;
        }
        c.entries.push_back(e);
    }
    return 0;
}

// The cameras being stopped, shared with the threads that stop them (which
// may outlive Stop when a call is still in flight).
struct Service::Teardown {
    std::vector<std::unique_ptr<Camera>> cameras;
    std::atomic<size_t> next{0};
    std::mutex mu;
    std::condition_variable cv;
    size_t pending = 1;  // threads not finished (the hub's, and the workers); under mu

    void Finished() {
        std::lock_guard<std::mutex> lock(mu);
        --pending;
        cv.notify_all();
    }
};

struct Service::Camera {
    int id = 0;
    CameraSettings record;
    std::vector<GuardScheduleEntry> entries;
    std::string problem;  // from the schedule read
    std::unique_ptr<PatrolExecutor> executor;
    std::unique_ptr<GuardExecutor> guard;
    std::unique_ptr<onvif::EventSource> events;  // null: no events (not ONVIF)
    int repeat = 1, pause = 1, eventValid = 10;  // the guard's Init values

    bool judged = false;            // Tick has worked out the entry in force once
    bool entriesChanged = false;    // since then
    time_t judgedAt = 0, next = 0;  // when, and when it may change (GuardScheduleAt)
    bool inForce = false;
    GuardScheduleEntry entry;  // in force, when inForce
    time_t since = 0, until = 0;
    GuardScheduleInfo info{0, GUARD_MODE_OFF};  // as last given to AnalyzeSchedule
    EVENT_STATUS first{}, second{};             // as last read
    int state = GUARD_STATE_IDLE;               // as last seen
    bool eventsUp = false;
    std::string eventError;  // the event source's error as last logged
    std::string lastError;
    int64_t lastErrorUs = 0;  // wall time

    // The executor's run as last seen, when it was first seen, and when the
    // guard was last told to stop (its entry changed, or it was replaced): a
    // guard run that ends short with no stop asked since it began had a move
    // fail.
    PATROL_RUN_PROGRESS run{0, 0, PATROL_EXEC_NONE, 0, -1, 0, 0, 0, 0};
    int64_t runSeenUs = 0, stopAskedUs = 0;

    void Fail(const std::string& error) {
        lastError = error;
        lastErrorUs = WallMicros();
    }
};

Service::Service(const Options& options)
    : options_(options), hub_(std::make_unique<onvif::EventHub>()) {}

Service::~Service() { Stop(); }

void Service::Start() {
    loaderDone_ = false;  // before any other thread runs
    loader_ = std::thread(&Service::LoaderMain, this);
}

void Service::Reload() {
    std::lock_guard<std::mutex> lock(loaderMu_);
    reload_ = true;
    loaderWake_.notify_all();
}

void Service::LoaderMain() {
    std::string fingerprint;
    bool failing = false;
    std::unique_lock<std::mutex> lock(loaderMu_);
    while (!quit_) {
        reload_ = false;
        lock.unlock();
        tzset();  // the host's zone may have been changed
        std::string now, error;
        auto schedule = std::make_unique<Schedule>();
        if (GuardScheduleFingerprint(&now) != 0) {
            std::string where, why;
            error = HostDBCheck(&where, &why) != 0
                        ? "cannot reach PostgreSQL at " + where + ": " + why
                        : "the guard_schedule table cannot be read (run 'ptzpatrol init-db')";
        } else if (now != fingerprint && LoadSchedule(schedule.get()) != 0) {
            error = "reading the schedule failed";
        }
        if (!error.empty() && !failing) Log(LOG_ERR, "schedule: %s", error.c_str());
        if (error.empty() && failing) Log(LOG_NOTICE, "schedule: read again");
        failing = !error.empty();
        if (error.empty() && now != fingerprint) {
            for (const std::string& p : schedule->problems) Log(LOG_WARNING, "%s", p.c_str());
        }
        lock.lock();
        readError_ = error;
        if (error.empty()) {
            readAt_ = time(nullptr);
            if (now != fingerprint) {
                fingerprint = now;
                fresh_ = std::move(schedule);
            }
        }
        loaderWake_.wait_for(lock, std::chrono::seconds(options_.pollSeconds),
                             [this] { return quit_ || reload_; });
    }
    loaderDone_ = true;
    loaderWake_.notify_all();
}

void Service::Step() {
    std::unique_ptr<Schedule> fresh;
    {
        std::lock_guard<std::mutex> lock(loaderMu_);
        fresh = std::move(fresh_);
    }
    std::lock_guard<std::mutex> lock(mu_);
    if (stopped_) return;
    const time_t now = time(nullptr);
    if (fresh) Apply(*fresh);
    const bool tick = now != lastTick_;
    lastTick_ = now;
    // The sources are looked at only when the hub says something changed.
    const uint64_t changes = hub_->Changes();
    const bool eventsMoved = changes != eventChanges_;
    const bool statusMoved = tick && changes != watchedChanges_;
    eventChanges_ = changes;
    if (statusMoved) watchedChanges_ = changes;
    for (auto& entry : cameras_) {
        Camera& c = *entry.second;
        if (tick) {
            Tick(c, now);
            if (statusMoved) WatchEvents(c);
            WatchGuard(c);
        } else if (c.events && eventsMoved) {
            EVENT_STATUS f, s;
            c.events->Read(&f, &s);
            if (f.active != c.first.active || f.reserved != c.first.reserved ||
                s.active != c.second.active || s.reserved != c.second.reserved)
                Analyze(c);
        }
    }
}

void Service::Apply(Schedule& schedule) {
    const time_t now = time(nullptr);
    for (auto it = cameras_.begin(); it != cameras_.end();) {
        if (schedule.cameras.count(it->first) != 0) {
            ++it;
            continue;
        }
        Camera& c = *it->second;
        c.guard->Terminate();
        c.executor->RemovePatrol(PATROL_EXEC_GUARD);
        Log(LOG_NOTICE, "camera %d: no longer guarded (no schedule entries)", c.id);
        it = cameras_.erase(it);  // its event source stops, its executor is joined
    }
    for (auto& scheduled : schedule.cameras) {
        const int id = scheduled.first;
        Schedule::Camera& s = scheduled.second;
        auto it = cameras_.find(id);
        if (it == cameras_.end()) {
            StartCamera(id, s, now);
            continue;
        }
        Camera& c = *it->second;
        if (s.entries != c.entries) {
            Log(LOG_NOTICE, "camera %d: schedule changed (entries: %zu)", id, s.entries.size());
            c.entries = s.entries;
            c.entriesChanged = true;
        }
        if (s.problem != c.problem && !s.problem.empty()) {
            Log(LOG_WARNING, "camera %d: %s", id, s.problem.c_str());
            c.Fail(s.problem);
        }
        c.problem = s.problem;
        if (!SameEndpoint(s.record, c.record)) {
            c.record = s.record;
            Log(LOG_NOTICE, "camera %d: camera record changed", id);
            MakeEvents(c);
        }
        c.record = s.record;
        Tick(c, now);
    }
    problems_ = schedule.problems;
}

void Service::StartCamera(int id, Schedule::Camera& s, time_t now) {
    auto owned = std::make_unique<Camera>();
    Camera& c = *owned;
    c.id = id;
    c.record = s.record;
    c.entries = s.entries;
    c.problem = s.problem;
    if (!s.problem.empty()) {
        c.Fail(s.problem);
        Log(LOG_WARNING, "camera %d: %s", id, s.problem.c_str());
    }
    const GuardScheduleInForce r = GuardScheduleAt(c.entries, now);
    if (r.entry) {
        c.repeat = r.entry->repeatCount;
        c.pause = r.entry->pauseMinutes;
        c.eventValid = r.entry->eventValidSeconds;
    }
    c.executor = std::make_unique<PatrolExecutor>();
    c.guard = std::make_unique<GuardExecutor>(id);
    c.guard->Init(c.executor.get(), c.repeat, c.pause, c.eventValid);
    Log(LOG_NOTICE, "camera %d: guarding (schedule entries: %zu; events %s)", id, c.entries.size(),
        IsOnvif(c.record) ? "over ONVIF" : "none: not an ONVIF camera");
    MakeEvents(c);
    cameras_[id] = std::move(owned);
    Tick(c, now);
}

void Service::MakeEvents(Camera& c) {
    c.events.reset();
    c.eventsUp = false;
    c.first = c.second = EVENT_STATUS{};
    if (!IsOnvif(c.record)) return;
    onvif::EventSourceOptions o;
    o.host = c.record.host;
    o.port = c.record.port;
    o.username = c.record.username;
    o.password = c.record.password;
    o.pullSeconds = options_.eventPullSeconds;
    o.subscriptionSeconds = options_.eventSubscriptionSeconds;
    o.stopTimeoutMs = options_.eventStopMs;
    c.events = std::make_unique<onvif::EventSource>(*hub_, o);
}

void Service::Tick(Camera& c, time_t now) {
    // The entry in force is worked out again only when it may have changed
    // (and once a minute, for a new time zone or a clock set back).
    if (!c.judged || c.entriesChanged || now >= c.next || now < c.judgedAt ||
        now - c.judgedAt >= 60) {
        const GuardScheduleInForce r = GuardScheduleAt(c.entries, now);
        const bool inForce = r.entry != nullptr;
        if (!c.judged || inForce != c.inForce ||
            (inForce && (*r.entry != c.entry || r.since != c.since))) {
            if (inForce) {
                Log(LOG_INFO, "camera %d: entry %d in force: patrol %d, mode %s, until %s", c.id,
                    r.entry->id, r.entry->patrolId, ScheduleModeText(r.entry->mode),
                    LocalIso(r.until).c_str());
                c.entry = *r.entry;
                c.since = r.since;
                c.until = r.until;
            } else if (c.judged) {
                Log(LOG_INFO, "camera %d: no entry in force", c.id);
            }
            c.inForce = inForce;
            c.judged = true;
        }
        c.entriesChanged = false;
        c.judgedAt = now;
        c.next = r.next;
    }
    const bool inForce = c.inForce;
    const GuardScheduleEntry* const e = inForce ? &c.entry : nullptr;
    if (inForce && (e->repeatCount != c.repeat || e->pauseMinutes != c.pause ||
                    e->eventValidSeconds != c.eventValid))
        ReplaceGuard(c, *e);
    const GuardScheduleInfo info =
        inForce ? GuardScheduleInfo{e->patrolId, e->mode} : GuardScheduleInfo{0, GUARD_MODE_OFF};
    if (info.patrolId != c.info.patrolId || info.mode != c.info.mode) c.stopAskedUs = WallMicros();
    c.info = info;
    Analyze(c);
}

void Service::Analyze(Camera& c) {
    if (c.events) {
        c.events->Read(&c.first, &c.second);
    } else {
        c.first = c.second = EVENT_STATUS{};
    }
    c.guard->AnalyzeSchedule(c.first, c.second, c.info);
}

void Service::ReplaceGuard(Camera& c, const GuardScheduleEntry& e) {
    c.guard->Terminate();
    c.executor->RemovePatrol(PATROL_EXEC_GUARD);
    c.stopAskedUs = WallMicros();
    c.repeat = e.repeatCount;
    c.pause = e.pauseMinutes;
    c.eventValid = e.eventValidSeconds;
    c.guard = std::make_unique<GuardExecutor>(c.id);
    c.guard->Init(c.executor.get(), c.repeat, c.pause, c.eventValid);
    Log(LOG_NOTICE,
        "camera %d: guard replaced for entry %d (repeat %d, pause %d min, events valid %d s); "
        "its run was withdrawn",
        c.id, e.id, c.repeat, c.pause, c.eventValid);
}

void Service::WatchGuard(Camera& c) {
    const PATROL_RUN_PROGRESS run = c.executor->GetRunProgress();
    const int64_t now = WallMicros();
    const bool fresh = run.runs != c.run.runs;
    if (fresh) c.runSeenUs = now;
    // Ended since the last look: the run seen running, or one begun and ended
    // between two looks (it began at most a tick before it was seen).
    if ((c.run.running || fresh) && !run.running && run.runs > 0 && run.type == PATROL_EXEC_GUARD &&
        run.runMoves < run.presetCount + 1 && c.stopAskedUs < c.runSeenUs - 2000000) {
        c.Fail("guard run of patrol " + std::to_string(run.patrolId) + " ended after " +
               std::to_string(run.runMoves) + " of " + std::to_string(run.presetCount + 1) +
               " moves: a move failed");
        Log(LOG_WARNING, "camera %d: %s", c.id, c.lastError.c_str());
    }
    c.run = run;
    const int state = c.guard->GetState();
    if (state == c.state) return;
    c.state = state;
    if (state == GUARD_STATE_RUNNING) {
        Log(LOG_INFO, "camera %d: guard running patrol %d", c.id, c.info.patrolId);
    } else {
        Log(LOG_INFO, "camera %d: guard %s", c.id, StateName(state));
    }
}

void Service::WatchEvents(Camera& c) {
    if (!c.events) return;
    const onvif::EventSourceStatus st = c.events->Status();
    if (st.subscribed != c.eventsUp) {
        c.eventsUp = st.subscribed;
        if (st.subscribed) {
            Log(LOG_NOTICE, "camera %d: events connected", c.id);
        } else {
            Log(LOG_WARNING, "camera %d: events lost: %s", c.id,
                st.lastError.empty() ? "no subscription" : st.lastError.c_str());
        }
        c.eventError = st.lastError;
    } else if (!st.subscribed && st.lastError != c.eventError) {
        // Never connected, or failing anew: each new reason once.
        Log(LOG_WARNING, "camera %d: events unavailable: %s", c.id, st.lastError.c_str());
        c.eventError = st.lastError;
    }
    if (!st.lastError.empty() && st.lastErrorUs > c.lastErrorUs) {
        c.lastError = st.lastError;
        c.lastErrorUs = st.lastErrorUs;
    }
}

json Service::CameraStatus(const Camera& c) {
    json j = {{"camera", c.id},
              {"host", c.record.host},
              {"port", c.record.port},
              {"vendor", c.record.vendor},
              {"entries", c.entries.size()}};
    if (c.inForce) {
        j["entry"] = {{"id", c.entry.id},
                      {"patrol", c.entry.patrolId},
                      {"mode", ScheduleModeText(c.entry.mode)},
                      {"days", ScheduleDaysText(c.entry.days)},
                      {"from", ScheduleTimeText(c.entry.startSecond)},
                      {"to", ScheduleTimeText(c.entry.endSecond)},
                      {"since", LocalIso(c.since)},
                      {"until", LocalIso(c.until)},
                      {"repeat", c.entry.repeatCount},
                      {"pause", c.entry.pauseMinutes},
                      {"eventValid", c.entry.eventValidSeconds}};
    } else {
        j["entry"] = nullptr;
    }
    j["guard"] = StateName(c.guard->GetState());
    j["guardInit"] = {{"repeat", c.repeat}, {"pause", c.pause}, {"eventValid", c.eventValid}};
    const PATROL_RUN_PROGRESS p = c.executor->GetRunProgress();
    j["run"] = {{"running", p.running != 0},
                {"patrol", p.patrolId},
                {"type", p.type == PATROL_EXEC_GUARD    ? "guard"
                         : p.type == PATROL_EXEC_DIRECT ? "direct"
                                                        : "none"},
                {"index", p.presetIndex},
                {"count", p.presetCount},
                {"position", p.position},
                {"runMoves", p.runMoves},
                {"moves", p.moves},
                {"runs", p.runs}};
    json events = {{"source", c.events ? "onvif" : "none"}};
    EVENT_STATUS read[2] = {{}, {}};
    onvif::EventSourceStatus st;
    if (c.events) {
        c.events->Read(&read[0], &read[1]);
        st = c.events->Status();
    }
    events["reachable"] = st.reachable;
    events["subscribed"] = st.subscribed;
    const onvif::EventInfo* info[2] = {&st.first, &st.second};
    const char* names[2] = {"first", "second"};
    for (int i = 0; i < 2; ++i) {
        events[names[i]] = {
            {"known", info[i]->known},
            {"state", info[i]->value},
            {"present", read[i].active == 1 &&
                            IsTimeStampValid(read[i].timestamp, c.eventValid * 1000000) == 1},
            {"alarms", info[i]->alarms},
            {"lastChange", IsoOrNull(info[i]->lastChangeUs)}};
    }
    j["events"] = events;
    j["lastError"] = c.lastError.empty() ? json(nullptr) : json(c.lastError);
    j["lastErrorTime"] = IsoOrNull(c.lastErrorUs);
    return j;
}

json Service::Status() {
    json cameras = json::array();
    std::vector<std::string> problems;
    {
        std::lock_guard<std::mutex> lock(mu_);
        for (const auto& c : cameras_) cameras.push_back(CameraStatus(*c.second));
        problems = problems_;
    }
    std::lock_guard<std::mutex> lock(loaderMu_);
    return {{"service", "ptzpatrold"},
            {"time", LocalIso(time(nullptr))},
            {"schedule",
             {{"readAt", readAt_ > 0 ? json(LocalIso(readAt_)) : json(nullptr)},
              {"error", readError_.empty() ? json(nullptr) : json(readError_)},
              {"pollSeconds", options_.pollSeconds},
              {"problems", problems}}},
            {"cameras", cameras}};
}

void Service::Stop() {
    const auto deadline = std::chrono::steady_clock::now() + kStopBound;
    {
        std::lock_guard<std::mutex> lock(loaderMu_);
        if (quit_) return;
        quit_ = true;
        loaderWake_.notify_all();
    }
    auto teardown = std::make_shared<Teardown>();
    {
        std::lock_guard<std::mutex> lock(mu_);
        stopped_ = true;
        for (auto& c : cameras_) teardown->cameras.push_back(std::move(c.second));
        cameras_.clear();
    }
    // The hub stops every subscription at once (their Unsubscribes bounded
    // together), while the guards and executors stop beside it: a few
    // threads each take the next camera, so an executor waiting for a call
    // in flight holds up only its own thread.
    std::vector<std::thread> threads;
    threads.emplace_back([teardown, hub = std::move(hub_)]() mutable {
        hub.reset();
        teardown->Finished();
    });
    const size_t workers = std::max<size_t>(1, std::min<size_t>(8, teardown->cameras.size() / 32));
    teardown->pending += workers;
    for (size_t i = 0; i < workers; ++i) {
        threads.emplace_back([teardown] {
            for (size_t i; (i = teardown->next++) < teardown->cameras.size();) {
                Camera& c = *teardown->cameras[i];
                c.guard->Terminate();
                c.executor->RemovePatrol(PATROL_EXEC_GUARD);
                c.executor.reset();
            }
            teardown->Finished();
        });
    }
    bool done;
    {
        std::unique_lock<std::mutex> lock(teardown->mu);
        done = teardown->cv.wait_until(lock, deadline, [&] { return teardown->pending == 0; });
    }
    {
        std::unique_lock<std::mutex> lock(loaderMu_);
        done = loaderWake_.wait_until(lock, deadline, [this] { return loaderDone_; }) && done;
    }
    if (!done) {
        // A camera or database call is still in flight: the owner ends the
        // process without waiting for it (nothing is left half-written: a
        // statement cut off commits nothing).
        for (std::thread& t : threads) t.detach();
        if (loader_.joinable()) loader_.detach();
        abandoned_ = true;
        Log(LOG_WARNING, "a camera or database call still in flight is not waited for");
        return;
    }
    for (std::thread& t : threads) t.join();
    if (loader_.joinable()) loader_.join();
    teardown->cameras.clear();  // the sources' Stop returns at once: the hub is gone
}

}  // namespace ptzd
