// ptzpatrol: the subcommands that store, list and fetch (database, cameras,
// patrols, presets, snapshots).
#include "commands.h"

#include <sys/stat.h>

#include <cstdlib>
#include <fstream>
#include <sstream>

#include "hostlib/camera/onvif_camera.h"
#include "hostlib/db/camera_status.h"
#include "patrol/patrol.h"
#include "snapshot/snapshot.h"

extern const char kSchemaSql[];  // hostlib/db/schema.sql, embedded at build time

namespace ptztool {
namespace {

using nlohmann::json;

std::string Quote(const std::string& text) { return "'" + OvDBEscapeString(text) + "'"; }

// The patrol's row, or kUnknownId.
void RequirePatrol(int id) {
    if (Query("SELECT id FROM patrol WHERE id = " + itos(id) + ";", {"id"}).empty())
        throw Error{kUnknownId, "no patrol " + std::to_string(id)};
}

// Loads a patrol without asking its camera (for deleting it).
Patrol LoadStoredOnly(int id) {
    const auto rows = Query("SELECT camId FROM patrol WHERE id = " + itos(id) + ";", {"camId"});
    if (rows.empty()) throw Error{kUnknownId, "no patrol " + std::to_string(id)};
    const int camId = atoi(rows[0][0].c_str());
    HostSetCamConnStatus(camId, CAM_CONN_OFFLINE);  // this process only: no preset sync
    Patrol patrol;
    if (patrol.Load(id) != 0)
        throw Error{kDbError, "loading patrol " + std::to_string(id) + " failed"};
    HostSetCamConnStatus(camId, CAM_CONN_ONLINE);
    return patrol;
}

json PresetsJson(const Patrol& patrol) {
    json out = json::array();
    for (int i = 0; i < patrol.GetPresetListNum(); ++i) {
        PRESET_INFO p{0, ""};
        patrol.GetPresetFromList(i, &p);
        out.push_back({{"position", p.position}, {"name", p.name}});
    }
    return out;
}

}  // namespace

int InitDb() {
    RequireDatabase(false);
    Exec(kSchemaSql);
    Out::Emit("tables ready (patrol, patrol_preset, camera, guard_schedule)", {{"event", "init-db"}, {"ok", true}});
    return kOk;
}

int CameraAdd(const CameraAddOptions& o) {
    if (o.vendor != "onvif" && o.vendor != "userdefined")
        throw Error{kUsage, "--vendor must be onvif or userdefined"};
    if (o.vendor == "userdefined" && o.path.empty())
        throw Error{kUsage, "a userdefined camera needs --path (where it serves its image)"};
    if (o.fetch != "image" && o.fetch != "stream")
        throw Error{kUsage, "--fetch must be image or stream"};
    if (o.port < 1 || o.port > 65535) throw Error{kUsage, "--port must be 1 to 65535"};
    std::string password;
    if (!o.passwordFile.empty()) {
        std::ifstream in(o.passwordFile);
        if (!in) throw Error{kNoInput, "cannot read the password file " + o.passwordFile};
        std::getline(in, password);
        if (!password.empty() && password.back() == '\r') password.pop_back();
    } else if (const char* env = getenv("PTZ_CAMERA_PASSWORD")) {
        password = env;
    }
    RequireDatabase(true);
    const std::string id = o.id > 0 ? itos(o.id) : "(SELECT COALESCE(MAX(id), 0) + 1 FROM camera)";
    if (o.id > 0 && !Query("SELECT id FROM camera WHERE id = " + id + ";", {"id"}).empty())
        throw Error{kUsage, "camera " + id + " exists already"};
    const auto rows = Query(
        "INSERT INTO camera (id, host, port, username, password, vendor, channel, path, liveReso, "
        "snapshotType) VALUES (" +
            id + ", " + Quote(o.host) + ", " + itos(o.port) + ", " + Quote(o.user) + ", " +
            Quote(password) + ", " + Quote(o.vendor) + ", " + Quote(o.channel) + ", " +
            Quote(o.path) + ", " + Quote(o.reso) + ", " + (o.fetch == "stream" ? "2" : "1") +
            ") RETURNING id;",
        {"id"});
    const int newId = rows.empty() ? 0 : atoi(rows[0][0].c_str());
    Out::Emit("camera " + std::to_string(newId) + " added: " + o.vendor + " at " + o.host + ":" +
                  std::to_string(o.port),
              {{"event", "camera-added"}, {"id", newId}});
    return kOk;
}

int CameraList() {
    RequireDatabase(true);
    const auto rows = Query(
        "SELECT id, host, port, username, vendor, channel, path, snapshotType FROM camera ORDER BY "
        "id;",
        {"id", "host", "port", "username", "vendor", "channel", "path", "snapshotType"});
    if (rows.empty() && !Out::Json()) Out::Emit("no cameras", {});
    for (const auto& r : rows) {
        std::string text =
            r[0] + "\t" + r[4] + "\t" + r[1] + ":" + r[2] + (r[3].empty() ? "" : "\tuser " + r[3]);
        if (!r[5].empty()) text += "\tchannel " + r[5];
        if (!r[6].empty()) text += "\tpath " + r[6] + (r[7] == "2" ? " (stream)" : "");
        Out::Emit(text, {{"id", atoi(r[0].c_str())},
                         {"host", r[1]},
                         {"port", atoi(r[2].c_str())},
                         {"user", r[3]},
                         {"vendor", r[4]},
                         {"channel", r[5]},
                         {"path", r[6]},
                         {"fetch", r[7] == "2" ? "stream" : "image"}});
    }
    return kOk;
}

int CameraRemove(int camId) {
    RequireDatabase(true);
    LoadCamera(camId);
    // Its patrols go with it.
    int patrols = 0;
    for (const PATROL_PARTIAL_INFO& info : PatrolPartialGetAll(camId)) {
        Patrol patrol = LoadStoredOnly(info.id);
        if (patrol.Delete() != 0)
            throw Error{kDbError, "deleting patrol " + std::to_string(info.id) + " failed"};
        ++patrols;
    }
    const int entries = DeleteScheduleEntries("camId = " + itos(camId));
    Exec("DELETE FROM camera WHERE id = " + itos(camId) + ";");
    SnapshotFileDelete(camId);
    Out::Emit("camera " + std::to_string(camId) + " removed, with " + std::to_string(patrols) +
                  " patrol(s) and " + std::to_string(entries) + " schedule entries",
              {{"event", "camera-removed"},
               {"id", camId},
               {"patrols", patrols},
               {"scheduleEntries", entries}});
    return kOk;
}

int Presets(int camId) {
    RequireDatabase(true);
    const Camera camera = LoadCamera(camId);
    for (const auto& p : CameraPresets(camera))
        Out::Emit(std::to_string(p.first) + "\t" + p.second,
                  {{"position", p.first}, {"name", p.second}});
    return kOk;
}

int PatrolCreate(int camId, const std::string& name, int stay,
                 const std::vector<std::string>& presetArgs) {
    if (stay < 0 || stay > 2147) throw Error{kUsage, "--stay must be 0 to 2147 seconds"};
    std::vector<PRESET_INFO> presets;
    for (const std::string& given : presetArgs) {
        const size_t colon = given.find(':');
        const std::string number = given.substr(0, colon);
        char* end = nullptr;
        const long position = strtol(number.c_str(), &end, 10);
        if (number.empty() || *end != '\0' || position < INT32_MIN || position > INT32_MAX)
            throw Error{kUsage, "a preset is POSITION or POSITION:NAME, not '" + given + "'"};
        presets.push_back({static_cast<int>(position),
                           colon == std::string::npos ? std::string() : given.substr(colon + 1)});
    }
    RequireDatabase(true);
    const Camera camera = LoadCamera(camId);
    // Positions the camera has; names it gives where none was given.
    const std::map<int, std::string> known = CameraPresets(camera);
    Patrol patrol(camId, name, static_cast<unsigned int>(stay));
    for (PRESET_INFO& p : presets) {
        auto it = known.find(p.position);
        if (it == known.end())
            throw Error{kUnknownId, "camera " + std::to_string(camId) + " has no preset " +
                                        std::to_string(p.position) + " (see 'ptzpatrol presets " +
                                        std::to_string(camId) + "')"};
        if (p.name.empty()) p.name = it->second;
        patrol.AddPresetToList(p);
    }
    if (patrol.Save() != 0) throw Error{kDbError, "saving the patrol failed"};
    Out::Emit("patrol " + std::to_string(patrol.GetId()) + " '" + patrol.GetName() +
                  "' saved: " + std::to_string(patrol.GetPresetListNum()) +
                  (patrol.GetPresetListNum() == 1 ? " preset, stay " : " presets, stay ") +
                  std::to_string(stay) + " s",
              {{"event", "patrol-created"},
               {"id", patrol.GetId()},
               {"camera", camId},
               {"name", patrol.GetName()},
               {"stay", stay},
               {"presets", PresetsJson(patrol)}});
    return kOk;
}

int PatrolList(int camId) {
    RequireDatabase(true);
    LoadCamera(camId);
    const auto list = PatrolPartialGetAll(camId);
    if (list.empty() && !Out::Json())
        Out::Emit("camera " + std::to_string(camId) + " has no patrols", {});
    for (const PATROL_PARTIAL_INFO& p : list)
        Out::Emit(std::to_string(p.id) + "\t" + p.name, {{"id", p.id}, {"name", p.name}});
    return kOk;
}

int PatrolShow(int id) {
    RequireDatabase(true);
    RequirePatrol(id);
    // The presets as stored, to tell which ones the load drops.
    const auto stored =
        Query("SELECT position, name FROM patrol_preset WHERE patrolId = " + itos(id) +
                  " ORDER BY sequence;",
              {"position", "name"});
    Patrol patrol;
    if (patrol.Load(id) != 0)
        throw Error{kDbError, "loading patrol " + std::to_string(id) + " failed"};
    const onvif::Diagnosis sync = onvif::LastDiagnosis();
    const Camera camera = LoadCamera(patrol.GetCamId());

    json dropped = json::array();
    std::vector<std::string> droppedText;
    for (const auto& row : stored) {
        const int position = atoi(row[0].c_str());
        bool kept = false;
        for (int i = 0; i < patrol.GetPresetListNum() && !kept; ++i) {
            PRESET_INFO p{0, ""};
            patrol.GetPresetFromList(i, &p);
            kept = p.position == position;
        }
        if (!kept) {
            dropped.push_back({{"position", position}, {"name", row[1]}});
            droppedText.push_back(row[0] + " (" + row[1] + ")");
        }
    }
    std::string checked = "checked against the camera";
    if (!IsOnvif(camera)) {
        checked = "not checked: the camera has no PTZ presets";
    } else if (sync.failure != onvif::Failure::kNone) {
        checked = "not checked, the camera did not answer: " + sync.detail;
    }
    if (Out::Json()) {
        Out::Emit("", {{"id", patrol.GetId()},
                       {"camera", patrol.GetCamId()},
                       {"name", patrol.GetName()},
                       {"stay", patrol.GetStayTime()},
                       {"presets", PresetsJson(patrol)},
                       {"dropped", dropped},
                       {"checked", sync.failure == onvif::Failure::kNone && IsOnvif(camera)}});
        return kOk;
    }
    Out::Emit("patrol " + std::to_string(id) + " '" + patrol.GetName() + "' of camera " +
                  std::to_string(patrol.GetCamId()) + ", stay " +
                  std::to_string(patrol.GetStayTime()) + " s, presets " + checked + ":",
              {});
    for (int i = 0; i < patrol.GetPresetListNum(); ++i) {
        PRESET_INFO p{0, ""};
        patrol.GetPresetFromList(i, &p);
        Out::Emit("  " + std::to_string(i + 1) + ". position " + std::to_string(p.position) + "\t" +
                      p.name,
                  {});
    }
    for (const std::string& d : droppedText)
        Out::Emit("  dropped: position " + d + ": the camera no longer has it", {});
    return kOk;
}

int PatrolDelete(int id) {
    RequireDatabase(true);
    Patrol patrol = LoadStoredOnly(id);
    if (patrol.Delete() != 0)
        throw Error{kDbError, "deleting patrol " + std::to_string(id) + " failed"};
    // Its schedule entries would have nothing to run.
    const int entries = DeleteScheduleEntries("patrolId = " + itos(id));
    Out::Emit("patrol " + std::to_string(id) + " deleted" +
                  (entries > 0 ? ", with " + std::to_string(entries) + " schedule entries" : ""),
              {{"event", "patrol-deleted"}, {"id", id}, {"scheduleEntries", entries}});
    return kOk;
}

SnapshotTaken TakeSnapshot(const Camera& camera, const std::string& file) {
    Api api = MakeApi(camera);
    std::string path;
    int port = camera.GetPort(), type = 0;
    if (!api || api->SetReso(camera.GetLiveReso()) != 0 ||
        api->GetSnapshotPath(path, port, type) != 0)
        ThrowCameraError(camera, "asking where its snapshot is served");
    const std::string url = "http://" + camera.GetHost() + ":" + std::to_string(port) + path;
    SnapshotTaken taken{file, 0, type, url};
    if (file.empty()) {
        Camera record = camera;
        if (SnapshotFileGet(&record) != 0)
            throw Error{kCameraRefused, "snapshot from " + url + " failed"};
        taken.file = "/tmp/ov_snapshot_id_" + std::to_string(camera.GetId()) + ".jpg";
        struct stat st;
        taken.bytes = stat(taken.file.c_str(), &st) == 0 ? static_cast<long>(st.st_size) : 0;
        return taken;
    }
    unsigned char* buffer = nullptr;
    int size = 0;
    if (SnapshotGet(camera.GetHost(), camera.GetPort(), camera.GetUsername(), camera.GetPassword(),
                    *api, camera.GetLiveReso(), &buffer, &size) != 0)
        throw Error{kCameraRefused, "snapshot from " + url + " failed"};
    std::unique_ptr<unsigned char, void (*)(unsigned char*)> hold(buffer, SnapshotFree);
    std::ofstream out(file, std::ios::binary | std::ios::trunc);
    out.write(reinterpret_cast<const char*>(buffer), size);
    out.close();
    if (!out) throw Error{kCantCreate, "cannot write " + file};
    taken.bytes = size;
    return taken;
}

json SnapshotJson(const SnapshotTaken& s) {
    return {{"file", s.file},
            {"bytes", s.bytes},
            {"type", s.type == 2 ? "mjpeg-part" : "image"},
            {"url", s.url}};
}

std::string SnapshotText(const SnapshotTaken& s) {
    return s.file + " (" + std::to_string(s.bytes) + " bytes, " +
           (s.type == 2 ? "first part of an MJPEG stream" : "single image") + ")";
}

int Snapshot(int camId, const std::string& file) {
    RequireDatabase(true);
    const Camera camera = LoadCamera(camId);
    const SnapshotTaken s = TakeSnapshot(camera, file);
    json j = SnapshotJson(s);
    j["event"] = "snapshot";
    j["camera"] = camId;
    j["time"] = IsoTime();
    Out::Emit(
        ClockText() + "  snapshot of camera " + std::to_string(camId) + ": " + SnapshotText(s), j);
    return kOk;
}

}  // namespace ptztool
