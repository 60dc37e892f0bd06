// Helpers for the executor unit tests: patrols scripted into the fake
// database and camera, the moves the fake camera saw, and log matching.
#ifndef TESTS_EXECUTOR_EXECUTOR_TEST_UTIL_H
#define TESTS_EXECUTOR_EXECUTOR_TEST_UTIL_H

#include <chrono>
#include <algorithm>
#include <cctype>
#include <string>
#include <vector>

#include "fake/fake_host.h"

namespace extest {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

struct StoredPatrol {
    int id;
    int camId;
    int stayTime;
    std::vector<int> positions;
};

inline std::string CameraHostName(int camId) { return "cam" + std::to_string(camId); }

// Scripts the two SELECTs of Patrol::Load and gives the camera the positions,
// so that the preset synchronisation keeps them. Call before any executor
// thread can reach the camera.
inline void StorePatrol(const StoredPatrol& p) {
    fake::Row row{{"id", std::to_string(p.id)},
                  {"camId", std::to_string(p.camId)},
                  {"name", "patrol" + std::to_string(p.id)},
                  {"stayTime", std::to_string(p.stayTime)}};
    fake::OnSql("SELECT * FROM patrol WHERE id = " + std::to_string(p.id) + ";", {0, {row}});
    fake::Answer presets;
    for (int position : p.positions) {
        presets.rows.push_back(
            {{"position", std::to_string(position)}, {"name", "P" + std::to_string(position)}});
    }
    fake::OnSql("FROM patrol_preset WHERE patrolId = " + std::to_string(p.id) + " ORDER BY",
                presets);
    fake::FakeCamera camera;
    camera.settings.id = p.camId;
    camera.settings.host = CameraHostName(p.camId);
    camera.settings.port = 80;
    camera.settings.vendor = "onvif";
    fake::AddCamera(camera);
    for (int position : p.positions) {
        fake::CameraHost(camera.settings.host).presets[position] = "P" + std::to_string(position);
    }
}

// "5 kelo5" for each position.
inline std::vector<std::string> MovesTo(const std::vector<int>& positions) {
    std::vector<std::string> out;
    for (int p : positions) out.push_back(std::to_string(p) + " kelo" + std::to_string(p));
    return out;
}

inline bool WaitForMoves(size_t count, std::chrono::milliseconds timeout = 3000ms) {
    return fake::WaitFor([count] { return fake::Moves().size() >= count; }, timeout);
}

// When the fake camera received each GoPreset.
inline std::vector<Clock::time_point> MoveTimes() {
    std::vector<Clock::time_point> out;
    for (const auto& call : fake::CameraCalls()) {
        if (call.what.rfind("GoPreset ", 0) == 0) out.push_back(call.when);
    }
    return out;
}

// How often patrol `id` was loaded (its row read).
inline int Loads(int id) {
    int n = 0;
    const std::string row = "SELECT * FROM patrol WHERE id = " + std::to_string(id) + ";";
    for (const auto& s : fake::Statements()) n += (s == row);
    return n;
}

// Whether a line "<file>:<line>:<function>(): <message>" was logged.
inline bool Logged(const std::string& file, const std::string& function,
                   const std::string& message) {
    const std::string prefix = file + ":";
    const std::string suffix = ":" + function + "(): " + message;
    for (const auto& text : fake::LogTexts()) {
        if (text.rfind(prefix, 0) != 0 || text.size() < prefix.size() + suffix.size()) continue;
        if (text.compare(text.size() - suffix.size(), suffix.size(), suffix) != 0) continue;
        const std::string line = text.substr(prefix.size(), text.size() - prefix.size() - suffix.size());
        if (!line.empty() && std::all_of(line.begin(), line.end(),
                                         [](unsigned char c) { return std::isdigit(c) != 0; })) {
            return true;
        }
    }
    return false;
}

inline double Seconds(Clock::duration d) { return std::chrono::duration<double>(d).count(); }

}  // namespace extest

#endif  // TESTS_EXECUTOR_EXECUTOR_TEST_UTIL_H
