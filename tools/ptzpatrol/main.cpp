// ptzpatrol: the library's patrols, guards and snapshots from the command
// line, through the public headers and our host layer (libptzhost), as a host
// program would use them. See `ptzpatrol --help` and README.md.
#include <syslog.h>

#include <CLI/CLI.hpp>
#include <cstdio>
#include <iostream>

#include "commands.h"
#include "hostlib/camera/onvif_camera.h"

using namespace ptztool;

namespace {

const char* const kExitCodes =
    "Exit codes: 0 ok, 64 bad arguments, 65 unknown id (camera, patrol, preset), 66 password "
    "file unreadable, 68 camera does not answer, 69 PostgreSQL (status: ptzpatrold) unreachable, 73 "
    "output file not written, 74 database statement failed, 76 camera refused the request (status: "
    "ptzpatrold gave no status), 77 camera refused the "
    "credentials, 78 no ptzpatrol tables (run init-db), 130 stopped by Ctrl-C.";

}  // namespace

int main(int argc, char** argv) {
    CLI::App app{
        "ptzpatrol: PTZ patrols, guards and snapshots of network cameras.\n"
        "The database comes from the libpq environment (PGHOST, PGPORT, PGDATABASE, PGUSER, ...)."};
    app.name("ptzpatrol");
    app.footer(kExitCodes);
    app.require_subcommand(1);
    app.fallthrough();
    bool json = false, verbose = false;
    int timeoutMs = 5000;
    app.add_flag("--json", json, "One JSON object per line instead of text");
    app.add_flag("-v,--verbose", verbose, "Also print the library's log lines on stderr");
    app.add_option("--camera-timeout", timeoutMs, "Bound of each camera call, in ms (default 5000)")
        ->check(CLI::Range(100, 600000));

    std::function<int()> command;
    const auto on = [&command](CLI::App* sub, std::function<int()> f) {
        sub->callback([&command, f] { command = f; });
    };

    on(app.add_subcommand("init-db", "Create the tables (idempotent)"), [] { return InitDb(); });

    CLI::App* camera = app.add_subcommand("camera", "Cameras: add, list, remove");
    camera->require_subcommand(1);
    CameraAddOptions add;
    CLI::App* cameraAdd = camera->add_subcommand(
        "add",
        "Add a camera. The password comes from --password-file or $PTZ_CAMERA_PASSWORD, never the "
        "command line");
    cameraAdd->add_option("--host", add.host, "Address of the camera")->required();
    cameraAdd->add_option("--port", add.port, "HTTP port (default 80)");
    cameraAdd->add_option("--user", add.user, "User name");
    cameraAdd->add_option("--password-file", add.passwordFile,
                          "File whose first line is the password");
    cameraAdd->add_option("--vendor", add.vendor,
                          "onvif (default) or userdefined (HTTP image, no PTZ)");
    cameraAdd->add_option("--channel", add.channel, "Video source, 1-based (onvif)");
    cameraAdd->add_option("--id", add.id, "Camera id (default: the next free one)")
        ->check(CLI::PositiveNumber);
    cameraAdd->add_option("--path", add.path, "userdefined: request path of the image");
    cameraAdd->add_option("--fetch", add.fetch, "userdefined: image (default) or stream (MJPEG)");
    cameraAdd->add_option("--reso", add.reso, "Snapshot resolution WxH (onvif: picks the profile)");
    on(cameraAdd, [&add] { return CameraAdd(add); });
    on(camera->add_subcommand("list", "List the cameras"), [] { return CameraList(); });
    int camId = 0, patrolId = 0;
    CLI::App* cameraRemove = camera->add_subcommand("remove", "Remove a camera and its patrols");
    cameraRemove->add_option("ID", camId, "Camera id")->required();
    on(cameraRemove, [&camId] { return CameraRemove(camId); });

    CLI::App* presets = app.add_subcommand("presets", "The presets the camera reports");
    presets->add_option("CAMID", camId, "Camera id")->required();
    on(presets, [&camId] { return Presets(camId); });

    CLI::App* patrol = app.add_subcommand("patrol", "Patrols: create, list, show, delete");
    patrol->require_subcommand(1);
    std::string name;
    int stay = -1;
    std::vector<std::string> positions;
    CLI::App* create =
        patrol->add_subcommand("create", "Save a patrol of the camera's presets, in order");
    create->add_option("CAMID", camId, "Camera id")->required();
    create->add_option("NAME", name, "Patrol name")->required();
    create
        ->add_option("PRESETS", positions, "POSITION or POSITION:NAME (default: the camera's name)")
        ->required();
    create->add_option("--stay", stay, "Seconds at each preset (0 to 2147)")->required();
    on(create, [&] { return PatrolCreate(camId, name, stay, positions); });
    CLI::App* list = patrol->add_subcommand("list", "Ids and names of a camera's patrols");
    list->add_option("CAMID", camId, "Camera id")->required();
    on(list, [&camId] { return PatrolList(camId); });
    CLI::App* show = patrol->add_subcommand(
        "show", "Load a patrol: presets the camera no longer has are dropped, and said so");
    show->add_option("ID", patrolId, "Patrol id")->required();
    on(show, [&patrolId] { return PatrolShow(patrolId); });
    CLI::App* del = patrol->add_subcommand("delete", "Delete a patrol");
    del->add_option("ID", patrolId, "Patrol id")->required();
    on(del, [&patrolId] { return PatrolDelete(patrolId); });

    RunOptions runOptions;
    CLI::App* run = app.add_subcommand(
        "run",
        "Run a patrol once as a direct request, printing each move; Ctrl-C stops it (exit 130)");
    run->add_option("ID", patrolId, "Patrol id")->required();
    run->add_option("--snapshots", runOptions.snapshotDir,
                    "Take a snapshot after each move, into DIR");
    on(run, [&] { return Run(patrolId, runOptions); });

    GuardOptions guardOptions;
    CLI::App* guard = app.add_subcommand(
        "guard",
        "Guard a patrol: runs it from a schedule entry and two events. Reads lines on stdin: "
        "'first on|off', 'second on|off', 'direct ID' (a direct request), 'direct stop', 'quit'. "
        "End of input or Ctrl-C (exit 130) stops it");
    guard->add_option("ID", patrolId, "Patrol id")->required();
    guard->add_option("--mode", guardOptions.mode, "continuous, first, second, any (or off)")
        ->required();
    guard->add_option("--repeat", guardOptions.repeat,
                      "Runs per start (0: without end; default 1)");
    guard->add_option("--pause", guardOptions.pauseMinutes,
                      "Pause after the runs in continuous mode, minutes (default 1)");
    guard->add_option("--event-valid", guardOptions.eventValidSeconds,
                      "How long an event counts, seconds (default 10)");
    guard->add_option("--snapshots", guardOptions.snapshotDir,
                      "Take a snapshot after each move, into DIR");
    on(guard, [&] { return Guard(patrolId, guardOptions); });

    ScheduleAddOptions entry;
    CLI::App* schedule = app.add_subcommand(
        "schedule", "Weekly guard schedules that ptzpatrold follows: add, list, remove");
    schedule->require_subcommand(1);
    CLI::App* scheduleAdd = schedule->add_subcommand(
        "add",
        "Add an entry: on DAYS from FROM to TO (server time zone; TO exclusive, at or before FROM: "
        "the next day; equal: a whole day) guard PATROL in MODE. Of overlapping entries the one "
        "started last is in force");
    scheduleAdd->add_option("CAMID", entry.camId, "Camera id")->required();
    scheduleAdd->add_option("--patrol", entry.patrolId, "Patrol id (of this camera)")->required();
    scheduleAdd->add_option("--mode", entry.mode, "continuous, first, second, any (or off)")
        ->required();
    scheduleAdd->add_option("--days", entry.days, "mon,tue,... or mon-fri, or all (default)");
    scheduleAdd->add_option("--from", entry.from, "Start, HH:MM[:SS] (default 00:00)");
    scheduleAdd->add_option("--to", entry.to, "End, HH:MM[:SS] (default 00:00)");
    scheduleAdd->add_option("--repeat", entry.repeat, "Runs per start (0: without end; default 1)");
    scheduleAdd->add_option("--pause", entry.pauseMinutes,
                            "Pause after the runs in continuous mode, minutes (default 1)");
    scheduleAdd->add_option("--event-valid", entry.eventValidSeconds,
                            "How long an event counts, seconds (default 10)");
    on(scheduleAdd, [&entry] { return ScheduleAdd(entry); });
    CLI::App* scheduleList =
        schedule->add_subcommand("list", "A camera's entries; the one in force now is marked");
    scheduleList->add_option("CAMID", camId, "Camera id")->required();
    on(scheduleList, [&camId] { return ScheduleList(camId); });
    int entryId = 0;
    CLI::App* scheduleRemove = schedule->add_subcommand("remove", "Remove an entry");
    scheduleRemove->add_option("ID", entryId, "Entry id")->required();
    on(scheduleRemove, [&entryId] { return ScheduleRemove(entryId); });

    std::string daemon = "127.0.0.1:7478";
    CLI::App* status = app.add_subcommand(
        "status", "What ptzpatrold is doing: per camera the entry in force, the guard, the run, "
                  "the events and the last error");
    status->add_option("--daemon", daemon, "Where ptzpatrold listens (default 127.0.0.1:7478)");
    on(status, [&daemon] { return Status(daemon); });

    std::string output;
    CLI::App* snapshot = app.add_subcommand(
        "snapshot", "Take a snapshot: into /tmp/ov_snapshot_id_<CAMID>.jpg, or FILE with -o");
    snapshot->add_option("CAMID", camId, "Camera id")->required();
    snapshot->add_option("-o,--output", output, "Write the image to FILE");
    on(snapshot, [&] { return Snapshot(camId, output); });

    try {
        app.parse(argc, argv);
    } catch (const CLI::CallForHelp& e) {
        return app.exit(e);
    } catch (const CLI::CallForAllHelp& e) {
        return app.exit(e);
    } catch (const CLI::ParseError& e) {
        std::string what = e.what();
        for (char& c : what)
            if (c == '\n') c = ' ';
        fprintf(stderr, "ptzpatrol: %s (see --help)\n", what.c_str());
        return kUsage;
    }
    Out::SetJson(json);
    onvif::SetCallTimeoutMs(timeoutMs);
    if (verbose) openlog("ptzpatrol", LOG_PERROR, LOG_USER);
    try {
        return command ? command() : kUsage;
    } catch (const Error& e) {
        fprintf(stderr, "ptzpatrol: %s\n", e.message.c_str());
        return e.code;
    } catch (const std::exception& e) {
        fprintf(stderr, "ptzpatrol: %s\n", e.what());
        return 70;
    }
}
