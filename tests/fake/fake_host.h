// In-process fake of the host services for unit tests.
//
// Database: records every statement, answers from scripted rules, counts the
// results handed out and freed. Camera: records every call of the camera layer,
// with switches for faults. Syslog: captured line by line.
// All state is global (the library calls free functions); call fake::Reset()
// at the start of every test. Thread-safe: executor workers call in too.
#ifndef TESTS_FAKE_FAKE_HOST_H
#define TESTS_FAKE_FAKE_HOST_H

#include <chrono>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "host/camera.h"

namespace fake {

// ---- database ----

using Row = std::map<std::string, std::optional<std::string>>;  // column -> text (nullopt: NULL)

struct Answer {
    int rc = 0;             // what OvDBExecute returns
    std::vector<Row> rows;  // rows of the result
};

// A rule answers every statement that contains `match` (first match wins).
// `times` > 0: the rule is used that many times, then dropped.
void OnSql(const std::string& match, Answer answer, int times = 0);
// A handler sees every statement before the rules; returning an answer ends the search.
void OnSqlHandler(std::function<std::optional<Answer>(const std::string&)> handler);

std::vector<std::string> Statements();  // every statement, in order
int ResultsOutstanding();               // results made minus results freed
int NullResultsFreed();                 // KELODBFreeResult(nullptr) calls

// ---- camera ----

struct FakeCamera {
    CameraSettings settings;     // what Camera::Load gives (settings.id is the key)
    int connStatus = 1;          // GetCamConnStatus
    bool loadFails = false;      // Camera::Load returns -1
};

struct FakeCameraHost {  // keyed by host name: what the control object does
    bool apiNull = false;                    // newCameraAPI returns null
    bool userApiNull = true;                 // newUserDefinedAPI returns null
    int setResoRc = 0;
    int presetListRc = 0;
    std::map<int, std::string> presets;      // what GetPresetList reports
    std::vector<int> refusedPositions;       // GoPreset fails for these
    int snapshotPathRc = 0;
    std::string snapshotPath = "/snap.jpg";
    std::optional<int> snapshotPort;         // replaces the port when set
    int snapshotType = 1;
};

void AddCamera(const FakeCamera& camera);
FakeCameraHost& CameraHost(const std::string& host);  // created on first use

struct CameraCall {
    std::string what;  // "GetCamConnStatus 7", "Camera::Load 7", "newCameraAPI cam7 80 ...",
                       // "SetReso 640x480", "GetPresetList", "GetSnapshotPath", "GoPreset 5 kelo5",
                       // "releaseCameraAPI"
    std::chrono::steady_clock::time_point when;
};
std::vector<CameraCall> CameraCalls();
std::vector<std::string> CameraCallNames();  // the `what` of each call
std::vector<std::string> Moves();            // "5 kelo5" for every accepted or refused GoPreset
int ApisOutstanding();                       // control objects made minus released

// Runs inside every GoPreset before it answers (e.g. to block or count).
void OnGoPreset(std::function<void(int position, const std::string& name)> hook);
// Runs inside every GetPresetList before it answers.
void OnGetPresetList(std::function<void()> hook);

// ---- syslog ----

struct LogLine {
    int priority;
    std::string text;
};
std::vector<LogLine> Logs();
std::vector<std::string> LogTexts();

// ---- clocks ----

// While alive, what the calling thread reads from the wall clock
// (gettimeofday, clock_gettime(CLOCK_REALTIME)) and from the monotonic clock
// (clock_gettime(CLOCK_MONOTONIC)) is shifted by the given amounts, and its
// absolute sleeps on those clocks (clock_nanosleep with TIMER_ABSTIME) are
// shifted back: code runs as it would at moments the machine's clocks have not
// reached (2039, a monotonic clock past 2^31 s). Other threads and relative
// sleeps are left alone; std::chrono's clocks may or may not follow (the C++
// library may reach the C library by other names), so only differences of
// their readings are meaningful meanwhile. A shifted time that does not fit
// time_t fails as the C library's does (-1, EOVERFLOW), after storing it cut to
// time_t's width, so code that ignores the failure reads a plausible wrong
// time. Not nested.
class ClockShift {
public:
    ClockShift(std::chrono::microseconds wall, std::chrono::microseconds monotonic);
    ~ClockShift();
    ClockShift(const ClockShift&) = delete;
    ClockShift& operator=(const ClockShift&) = delete;
};

// Forgets every rule, record, camera and log line, and runs every hook that
// other fakes registered with ResetHook.
void Reset();
struct ResetHook {
    explicit ResetHook(std::function<void()> hook);
};

// Polls `condition` every millisecond until it holds or `timeout` passes.
bool WaitFor(const std::function<bool()>& condition, std::chrono::milliseconds timeout);

}  // namespace fake

#endif  // TESTS_FAKE_FAKE_HOST_H
