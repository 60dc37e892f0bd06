// Camera records from the camera table, and connection statuses.
#include <stdlib.h>

#include <map>
#include <mutex>
#include <string>

#include "host/camera.h"
#include "host/database.h"
#include "hostlib/camera/user_defined.h"
#include "hostlib/db/camera_status.h"

namespace {

std::mutex& StatusMutex() {
    static std::mutex mu;
    return mu;
}

std::map<int, int>& Statuses() {
    static std::map<int, int> statuses;
    return statuses;
}

std::string Text(DBResult_tag* result, const char* column) {
    const char* v = KELODBFetchField(result, 0, column);
    return v ? std::string(v) : std::string();
}

}  // namespace

int Camera::Load(int id, int /*option*/) {
    const std::string sql =
        "SELECT id, host, port, username, password, vendor, model, channel, "
        "path, liveReso, snapshotType FROM camera WHERE id = " +
        itos(id) + ";";
    DBResult_tag* result = nullptr;
    if (OvDBExecute(sql, &result) != 0) return -1;
    if (KELODBNumRows(result) != 1) {
        KELODBFreeResult(result);
        return -1;
    }
    CameraSettings s;
    s.id = id;
    s.host = Text(result, "host");
    s.port = static_cast<int>(strtol(Text(result, "port").c_str(), nullptr, 10));
    s.username = Text(result, "username");
    s.password = Text(result, "password");
    s.vendor = Text(result, "vendor");
    s.model = Text(result, "model");
    s.channel = Text(result, "channel");
    s.path = Text(result, "path");
    s.liveReso = Text(result, "liveReso");
    s.snapshotType = static_cast<int>(strtol(Text(result, "snapshotType").c_str(), nullptr, 10));
    KELODBFreeResult(result);
    settings_ = s;
    HostNoteSnapshotType(s.host, s.port, s.path, s.snapshotType);
    return 0;
}

void HostSetCamConnStatus(int camId, int status) {
    std::lock_guard<std::mutex> lock(StatusMutex());
    Statuses()[camId] = status;
}

void HostResetCamConnStatus() {
    std::lock_guard<std::mutex> lock(StatusMutex());
    Statuses().clear();
}

int GetCamConnStatus(int camId) {
    std::lock_guard<std::mutex> lock(StatusMutex());
    auto it = Statuses().find(camId);
    return it == Statuses().end() ? CAM_CONN_ONLINE : it->second;
}
