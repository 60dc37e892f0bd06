// ptzpatrol: the subcommands. Each returns an exit code or throws Error.
#ifndef TOOLS_PTZPATROL_COMMANDS_H
#define TOOLS_PTZPATROL_COMMANDS_H

#include <string>
#include <vector>

#include "tool.h"

namespace ptztool {

struct CameraAddOptions {
    int id = 0;  // 0: the next free id
    std::string host;
    int port = 80;
    std::string user, passwordFile;
    std::string vendor = "onvif";
    std::string channel, path, reso;
    std::string fetch = "image";  // userdefined: "image" or "stream"
};

int InitDb();
int CameraAdd(const CameraAddOptions& options);
int CameraList();
int CameraRemove(int camId);
int Presets(int camId);
int PatrolCreate(int camId, const std::string& name, int stay,
                 const std::vector<std::string>& presets);
int PatrolList(int camId);
int PatrolShow(int id);
int PatrolDelete(int id);
int Snapshot(int camId, const std::string& file);

struct RunOptions {
    std::string snapshotDir;  // a snapshot after each move, when set
};
int Run(int patrolId, const RunOptions& options);

struct GuardOptions {
    std::string mode = "continuous";
    int repeat = 1;
    int pauseMinutes = 1;
    int eventValidSeconds = 10;
    std::string snapshotDir;
};
int Guard(int patrolId, const GuardOptions& options);

// Weekly guard schedules (schedule.cpp).
struct ScheduleAddOptions {
    int camId = 0, patrolId = 0;
    std::string mode, days = "all", from = "00:00", to = "00:00";
    int repeat = 1, pauseMinutes = 1, eventValidSeconds = 10;
};
int ScheduleAdd(const ScheduleAddOptions& options);
int ScheduleList(int camId);
int ScheduleRemove(int id);
// Deletes the schedule entries that `where` (SQL) selects; how many. None
// when the database predates schedules.
int DeleteScheduleEntries(const std::string& where);
// The status of ptzpatrold at HOST:PORT.
int Status(const std::string& daemon);

// One snapshot: into `file`, or the camera's /tmp file when `file` is empty.
struct SnapshotTaken {
    std::string file;
    long bytes;
    int type;  // 1 single image, 2 first part of a multipart stream
    std::string url;
};
SnapshotTaken TakeSnapshot(const Camera& camera, const std::string& file);
nlohmann::json SnapshotJson(const SnapshotTaken& snapshot);
std::string SnapshotText(const SnapshotTaken& snapshot);

}  // namespace ptztool

#endif  // TOOLS_PTZPATROL_COMMANDS_H
