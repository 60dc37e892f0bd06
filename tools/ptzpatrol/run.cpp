// ptzpatrol run and guard: a PatrolExecutor (and a GuardExecutor) in this
// process, each move printed as the executor reports it.
#include <poll.h>
#include <unistd.h>

#include <chrono>
#include <map>
#include <thread>

#include "commands.h"
#include "executor/guardExecutor.h"
#include "executor/patrolExecutor.h"
#include "patrol/patrol.h"

namespace ptztool {
namespace {

using nlohmann::json;
using Clock = std::chrono::steady_clock;

constexpr auto kPoll = std::chrono::milliseconds(10);  // how often the run's progress is read

// Loads a patrol as the executor will (its presets checked against the
// camera). With `checkCamera`, the camera must answer first: a camera that
// does not fails at once with its own error, not after the load's wait.
Patrol LoadPatrol(int id, bool checkCamera) {
    const auto rows = Query("SELECT camId FROM patrol WHERE id = " + itos(id) + ";", {"camId"});
    if (rows.empty()) throw Error{kUnknownId, "no patrol " + std::to_string(id)};
    if (checkCamera) CameraPresets(LoadCamera(atoi(rows[0][0].c_str())));
    Patrol patrol;
    if (patrol.Load(id) != 0)
        throw Error{kDbError, "loading patrol " + std::to_string(id) + " failed"};
    return patrol;
}

// Prints the runs and moves of one executor as its progress changes.
class Watcher {
public:
    Watcher(PatrolExecutor& executor, const std::string& snapshotDir)
        : executor_(executor), snapshotDir_(snapshotDir) {}

    void Know(const Patrol& patrol) { patrols_[patrol.GetId()] = patrol; }

    // Reads the progress once and prints what changed since the last look.
    // Moves that came and went between two looks (a stay of 0, the closing
    // move of a run and the first of the next) are told from the counters.
    PATROL_RUN_PROGRESS Look() {
        const PATROL_RUN_PROGRESS p = executor_.GetRunProgress();
        const unsigned int fresh = p.moves - last_.moves;
        if (p.runs != last_.runs) {
            // The rest of the run seen last, then its end.
            const unsigned int inNew = static_cast<unsigned int>(p.runMoves);
            const unsigned int rest = fresh > inNew && last_.runs == p.runs - 1 ? fresh - inNew : 0;
            for (unsigned int k = 1; k <= rest; ++k)
                Moved(last_, last_.runMoves + static_cast<int>(k));
            if (last_.runs > 0 && (last_.running || rest > 0))
                RunEnded(last_, last_.runMoves + static_cast<int>(rest));
            RunStarted(p);
            for (int k = 1; k <= p.runMoves; ++k) Moved(p, k);
        } else {
            for (int k = last_.runMoves + 1; k <= p.runMoves; ++k) Moved(p, k);
            if (last_.running && !p.running) RunEnded(p, p.runMoves);
        }
        last_ = p;
        return p;
    }
    int RunMoves() const { return last_.runMoves; }

private:
    std::string PatrolName(int id) const {
        auto it = patrols_.find(id);
        return it == patrols_.end() ? std::string() : it->second.GetName();
    }
    // Position and name of preset `index` of patrol `id` as this process loaded it.
    PRESET_INFO Preset(int id, int index) const {
        auto it = patrols_.find(id);
        PRESET_INFO preset{0, ""};
        if (it != patrols_.end()) it->second.GetPresetFromList(index, &preset);
        return preset;
    }

    void RunStarted(const PATROL_RUN_PROGRESS& p) {
        auto it = patrols_.find(p.patrolId);
        const int stay = it == patrols_.end() ? 0 : it->second.GetStayTime();
        Out::Emit(ClockText() + "  run " + std::to_string(p.runs) + ": patrol " +
                      std::to_string(p.patrolId) + " '" + PatrolName(p.patrolId) + "', " +
                      std::to_string(p.presetCount) +
                      (p.presetCount == 1 ? " preset, stay " : " presets, stay ") +
                      std::to_string(stay) + " s, " + TypeName(p.type),
                  {{"event", "run"},
                   {"time", IsoTime()},
                   {"mono", Monotonic()},
                   {"run", p.runs},
                   {"patrol", p.patrolId},
                   {"name", PatrolName(p.patrolId)},
                   {"type", TypeName(p.type)},
                   {"count", p.presetCount},
                   {"stay", stay}});
    }

    // The k-th move (1-based) of the run that `p` describes.
    void Moved(const PATROL_RUN_PROGRESS& p, int k) {
        const bool closing = k == p.presetCount + 1;
        const int index = closing ? 0 : k - 1;
        const PRESET_INFO preset = Preset(p.patrolId, index);
        const int position = k == p.runMoves ? p.position : preset.position;
        json j = {{"event", "move"},
                  {"time", IsoTime()},
                  {"mono", Monotonic()},
                  {"run", p.runs},
                  {"patrol", p.patrolId},
                  {"type", TypeName(p.type)},
                  {"index", index},
                  {"count", p.presetCount},
                  {"position", position},
                  {"name", preset.name},
                  {"moves", p.moves - static_cast<unsigned int>(p.runMoves - k)},
                  {"closing", closing}};
        std::string text = ClockText() + "  " + TypeName(p.type) + "  patrol " +
                           std::to_string(p.patrolId) + "  preset " + std::to_string(index + 1) +
                           " of " + std::to_string(p.presetCount) + "  position " +
                           std::to_string(position) +
                           (preset.name.empty() ? "" : "  " + preset.name) +
                           (closing ? "  (back to the first preset)" : "");
        if (!snapshotDir_.empty()) {
            char file[64];
            snprintf(file, sizeof file, "/%03u-run%u-p%d.jpg",
                     static_cast<unsigned int>(j["moves"]), p.runs, position);
            auto it = patrols_.find(p.patrolId);
            try {
                const Camera camera = LoadCamera(it == patrols_.end() ? 0 : it->second.GetCamId());
                const SnapshotTaken s = TakeSnapshot(camera, snapshotDir_ + file);
                j["snapshot"] = SnapshotJson(s);
                text += "\n              snapshot " + SnapshotText(s);
            } catch (const Error& e) {
                j["snapshot_error"] = e.message;
                text += "\n              snapshot failed: " + e.message;
            }
        }
        Out::Emit(text, j);
    }

    // The end of the run that `p` describes, after `moves` moves.
    void RunEnded(const PATROL_RUN_PROGRESS& p, int moves) {
        const bool complete = moves == p.presetCount + 1;
        Out::Emit(ClockText() + "  run " + std::to_string(p.runs) + " ended after " +
                      std::to_string(moves) + " moves" +
                      (complete ? "" : " (gave way, or a move failed)"),
                  {{"event", "end"},
                   {"time", IsoTime()},
                   {"run", p.runs},
                   {"patrol", p.patrolId},
                   {"type", TypeName(p.type)},
                   {"moves", moves},
                   {"complete", complete}});
    }

    PatrolExecutor& executor_;
    std::string snapshotDir_;
    std::map<int, Patrol> patrols_;
    PATROL_RUN_PROGRESS last_ = {0, 0, PATROL_EXEC_NONE, 0, -1, 0, 0, 0, 0};
};

}  // namespace

int Run(int patrolId, const RunOptions& options) {
    RequireDatabase(true);
    const Patrol patrol = LoadPatrol(patrolId, true);
    const Camera camera = LoadCamera(patrol.GetCamId());
    if (patrol.GetPresetListNum() == 0)
        throw Error{kUnknownId,
                    "patrol " + std::to_string(patrolId) + " has no presets the camera has"};
    CatchStopSignals();

    PatrolExecutor executor;
    Watcher watcher(executor, options.snapshotDir);
    watcher.Know(patrol);
    watcher.Look();
    executor.Execute(patrolId, PATROL_EXEC_DIRECT);
    const auto asked = Clock::now();
    for (;;) {
        std::this_thread::sleep_for(kPoll);
        const PATROL_RUN_PROGRESS p = watcher.Look();
        if (gStopSignal != 0) {
            executor.RemovePatrol(PATROL_EXEC_DIRECT);
            Out::Emit(ClockText() + "  stopped", {{"event", "stopped"}, {"time", IsoTime()}});
            return kInterrupted;  // the executor stops and joins its worker on the way out
        }
        if (p.runs == 0 && Clock::now() - asked > std::chrono::seconds(15))
            throw Error{kDbError, "the executor did not start patrol " + std::to_string(patrolId)};
        if (p.runs > 0 && !p.running) break;
    }
    if (watcher.RunMoves() == patrol.GetPresetListNum() + 1) return kOk;
    // A move failed: tell why if the camera says so.
    CameraPresets(camera);
    throw Error{kCameraRefused, "camera " + std::to_string(camera.GetId()) +
                                    " refused a move after " + std::to_string(watcher.RunMoves()) +
                                    " moves (see the system log)"};
}

int Guard(int patrolId, const GuardOptions& o) {
    const std::map<std::string, int> modes = {{"off", GUARD_MODE_OFF},
                                              {"continuous", GUARD_MODE_CONTINUOUS},
                                              {"first", GUARD_MODE_FIRST_EVENT},
                                              {"second", GUARD_MODE_SECOND_EVENT},
                                              {"any", GUARD_MODE_ANY_EVENT}};
    auto mode = modes.find(o.mode);
    if (mode == modes.end())
        throw Error{kUsage, "--mode must be continuous, first, second, any or off"};
    if (o.pauseMinutes < 0 || o.pauseMinutes > 35)
        throw Error{kUsage, "--pause must be 0 to 35 minutes"};
    if (o.eventValidSeconds < 0 || o.eventValidSeconds > 2147)
        throw Error{kUsage, "--event-valid must be 0 to 2147 seconds"};
    RequireDatabase(true);
    const Patrol patrol = LoadPatrol(patrolId, true);
    CatchStopSignals();

    PatrolExecutor executor;
    Watcher watcher(executor, o.snapshotDir);
    watcher.Know(patrol);
    watcher.Look();
    GuardExecutor guard(1);
    guard.Init(&executor, o.repeat, o.pauseMinutes, o.eventValidSeconds);
    EVENT_STATUS first = {}, second = {};
    const GuardScheduleInfo entry = {patrolId, mode->second};
    const char* stateNames[] = {"idle", "running", "interval", "holdoff"};
    int state = GUARD_STATE_IDLE;
    auto lastSchedule = Clock::now() - std::chrono::seconds(1);
    std::string pending;
    bool inputOpen = true;
    Out::Emit(
        ClockText() + "  guard on patrol " + std::to_string(patrolId) + ", mode " + o.mode +
            ", repeat " + std::to_string(o.repeat) + ", pause " + std::to_string(o.pauseMinutes) +
            " min; input: first on|off, second on|off, direct ID, direct stop, quit",
        {{"event", "guard-start"}, {"time", IsoTime()}, {"patrol", patrolId}, {"mode", o.mode}});

    // One line of input; false: quit.
    const auto handle = [&](const std::string& line) -> bool {
        std::string word, arg;
        const size_t space = line.find(' ');
        word = line.substr(0, space);
        arg = space == std::string::npos ? "" : line.substr(space + 1);
        Out::Emit(ClockText() + "  input: " + line,
                  {{"event", "input"}, {"time", IsoTime()}, {"line", line}});
        if (word == "quit") return false;
        if ((word == "first" || word == "second") && (arg == "on" || arg == "off")) {
            EVENT_STATUS& e = word == "first" ? first : second;
            e.active = arg == "on" ? 1 : 0;
            gettimeofday(&e.timestamp, nullptr);
            guard.AnalyzeSchedule(first, second, entry);
        } else if (word == "direct" && arg == "stop") {
            executor.RemovePatrol(PATROL_EXEC_DIRECT);
        } else if (word == "direct" && !arg.empty()) {
            try {
                const Patrol direct = LoadPatrol(atoi(arg.c_str()), false);
                watcher.Know(direct);
                executor.Execute(direct.GetId(), PATROL_EXEC_DIRECT);
            } catch (const Error& e) {
                fprintf(stderr, "ptzpatrol: %s\n", e.message.c_str());
            }
        } else {
            fprintf(stderr,
                    "ptzpatrol: unknown input '%s' (first on|off, second on|off, direct ID, direct "
                    "stop, quit)\n",
                    line.c_str());
        }
        return true;
    };

    bool quit = false;
    while (!quit && gStopSignal == 0) {
        struct pollfd in = {0, POLLIN, 0};
        if (inputOpen && poll(&in, 1, static_cast<int>(kPoll.count())) > 0) {
            char buffer[512];
            const ssize_t n = read(0, buffer, sizeof buffer);
            if (n <= 0) {
                inputOpen = false;
                quit = true;  // end of input ends the guard
            } else {
                pending.append(buffer, static_cast<size_t>(n));
            }
            for (size_t nl; !quit && (nl = pending.find('\n')) != std::string::npos;) {
                std::string line = pending.substr(0, nl);
                pending.erase(0, nl + 1);
                if (!line.empty() && line.back() == '\r') line.pop_back();
                if (!line.empty()) quit = !handle(line);
            }
        } else if (!inputOpen) {
            std::this_thread::sleep_for(kPoll);
        }
        // The schedule entry in force, as a host hands it over from time to time.
        if (Clock::now() - lastSchedule >= std::chrono::milliseconds(250)) {
            guard.AnalyzeSchedule(first, second, entry);
            lastSchedule = Clock::now();
        }
        const int now = guard.GetState();
        if (now != state) {
            state = now;
            Out::Emit(ClockText() + "  guard: " + stateNames[now & 3],
                      {{"event", "guard"}, {"time", IsoTime()}, {"state", stateNames[now & 3]}});
        }
        watcher.Look();
    }
    guard.Terminate();
    executor.RemovePatrol(PATROL_EXEC_GUARD);
    executor.RemovePatrol(PATROL_EXEC_DIRECT);
    Out::Emit(ClockText() + "  guard stopped", {{"event", "stopped"}, {"time", IsoTime()}});
    return gStopSignal != 0 ? kInterrupted : kOk;
}

}  // namespace ptztool
