// ptzpatrol: errors, output, database and camera checks (see tool.h).
#include "tool.h"

#include <strings.h>
#include <sys/time.h>
#include <time.h>

#include <cstdio>
#include <iostream>

#include "hostlib/camera/onvif_camera.h"
#include "hostlib/db/database_config.h"

namespace ptztool {

volatile std::sig_atomic_t gStopSignal = 0;

namespace {

bool gJson = false;

void OnStopSignal(int sig) { gStopSignal = sig; }

std::string CameraName(const Camera& camera) {
    return "camera " + std::to_string(camera.GetId()) + " (" + camera.GetHost() + ":" +
           std::to_string(camera.GetPort()) + ")";
}

}  // namespace

void CatchStopSignals() {
    struct sigaction sa = {};
    sa.sa_handler = OnStopSignal;
    sigemptyset(&sa.sa_mask);
    sigaction(SIGINT, &sa, nullptr);
    sigaction(SIGTERM, &sa, nullptr);
}

void Out::SetJson(bool json) { gJson = json; }
bool Out::Json() { return gJson; }

void Out::Emit(const std::string& text, const nlohmann::json& object) {
    if (gJson) {
        std::cout << object.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace) << '\n';
    } else {
        std::cout << text << '\n';
    }
    std::cout.flush();
}

std::string ClockText() {
    struct timeval tv;
    gettimeofday(&tv, nullptr);
    struct tm local;
    localtime_r(&tv.tv_sec, &local);
    char text[64];
    snprintf(text, sizeof text, "%02d:%02d:%02d.%03d", local.tm_hour, local.tm_min, local.tm_sec,
             static_cast<int>(tv.tv_usec / 1000));
    return text;
}

std::string IsoTime() {
    struct timeval tv;
    gettimeofday(&tv, nullptr);
    struct tm utc;
    gmtime_r(&tv.tv_sec, &utc);
    char text[96];
    snprintf(text, sizeof text, "%04d-%02d-%02dT%02d:%02d:%02d.%03dZ", utc.tm_year + 1900,
             utc.tm_mon + 1, utc.tm_mday, utc.tm_hour, utc.tm_min, utc.tm_sec,
             static_cast<int>(tv.tv_usec / 1000));
    return text;
}

double Monotonic() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

void RequireDatabase(bool tables) {
    std::string where, error;
    if (HostDBCheck(&where, &error) != 0)
        throw Error{kDbUnavailable, "cannot reach PostgreSQL at " + where + ": " + error};
    if (!tables) return;
    const auto rows = Query(
        "SELECT (to_regclass('patrol') IS NOT NULL AND to_regclass('patrol_preset') IS NOT NULL "
        "AND to_regclass('camera') IS NOT NULL)::int AS ok;",
        {"ok"});
    if (rows.empty() || rows[0][0] != "1")
        throw Error{kNoTables, "the database has no ptzpatrol tables: run 'ptzpatrol init-db'"};
}

std::vector<std::vector<std::string>> Query(const std::string& sql,
                                            const std::vector<const char*>& columns) {
    std::vector<std::vector<std::string>> rows;
    if (!HostDBQuery(sql, columns, &rows)) throw Error{kDbError, "database statement failed: " + sql};
    return rows;
}

void Exec(const std::string& sql) {
    if (OvDBExecute(sql) != 0) throw Error{kDbError, "database statement failed: " + sql};
}

Camera LoadCamera(int camId) {
    Camera camera;
    if (camera.Load(camId, 0) != 0) throw Error{kUnknownId, "no camera " + std::to_string(camId)};
    return camera;
}

bool IsOnvif(const Camera& camera) { return strcasecmp(camera.GetVendor().c_str(), "onvif") == 0; }

Api MakeApi(const Camera& camera) {
    CameraAPI* api =
        newCameraAPI(camera.GetHost(), camera.GetPort(), camera.GetUsername(), camera.GetPassword(),
                     camera.GetVendor(), camera.GetModel(), camera.GetCH());
    if (api == nullptr)
        api = newUserDefinedAPI(camera.GetHost(), camera.GetPort(), camera.GetUsername(),
                                camera.GetPassword(), camera.GetPath(), "1");
    return Api(api);
}

void ThrowCameraError(const Camera& camera, const std::string& what) {
    const onvif::Diagnosis d = onvif::LastDiagnosis();
    const std::string where = CameraName(camera) + ": " + what;
    switch (d.failure) {
        case onvif::Failure::kUnreachable:
            throw Error{kCameraAbsent, where + ": no answer: " + d.detail};
        case onvif::Failure::kUnauthorized:
            throw Error{kCameraAuth, where + ": user name or password refused (" + d.detail + ")"};
        case onvif::Failure::kNoSuchPreset:
            throw Error{kUnknownId, where + ": " + d.detail};
        case onvif::Failure::kRefused:
            throw Error{kCameraRefused, where + ": refused: " + d.detail};
        case onvif::Failure::kNone:
            break;
    }
    throw Error{kCameraRefused, where + " failed"};
}

std::map<int, std::string> CameraPresets(const Camera& camera) {
    if (!IsOnvif(camera))
        throw Error{kCameraRefused, CameraName(camera) + " has no PTZ presets (vendor '" +
                                        camera.GetVendor() + "')"};
    Api api = MakeApi(camera);
    std::map<int, std::string> presets;
    if (!api || api->GetPresetList(presets) != 0) ThrowCameraError(camera, "reading its presets");
    return presets;
}

const char* TypeName(int type) { return type == 0 ? "guard" : type == 1 ? "direct" : "none"; }

}  // namespace ptztool
