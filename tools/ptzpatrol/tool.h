// ptzpatrol: what the subcommands share. Errors, exit codes, output for a
// person or as JSON lines, and the checks of the database and of a camera.
#ifndef TOOLS_PTZPATROL_TOOL_H
#define TOOLS_PTZPATROL_TOOL_H

#include <csignal>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "host/camera.h"
#include "host/database.h"

namespace ptztool {

// Exit codes, sysexits(3) style: one per kind of failure.
enum Exit {
    kOk = 0,
    kUsage = 64,          // bad arguments
    kUnknownId = 65,      // no camera or patrol of that id, or data the camera does not have
    kNoInput = 66,        // the password file cannot be read
    kCameraAbsent = 68,   // the camera does not answer (refused, timeout, no route)
    kDbUnavailable = 69,  // PostgreSQL cannot be reached
    kUnavailable = 69,    // status: ptzpatrold cannot be reached (a service, as PostgreSQL)
    kCantCreate = 73,     // the output file cannot be written
    kDbError = 74,        // a database statement failed
    kCameraRefused = 76,  // the camera answered but refused the request, or its image
    kProtocol = 76,       // status: ptzpatrold answered something else than its status
    kCameraAuth = 77,     // the camera refused the user name or password
    kNoTables = 78,       // the database has no ptzpatrol tables (run init-db)
    kInterrupted = 130,   // Ctrl-C
};

// A failure: one line for stderr and its exit code.
struct Error {
    int code;
    std::string message;
};

// Set by SIGINT and SIGTERM (installed by the commands that run until stopped).
extern volatile std::sig_atomic_t gStopSignal;
void CatchStopSignals();

// Output: a line for a person, or one JSON object per line with --json.
class Out {
public:
    static void SetJson(bool json);
    static bool Json();
    // Prints `text` (person) or `object` (JSON), then flushes.
    static void Emit(const std::string& text, const nlohmann::json& object);
};

// Wall-clock time of day with milliseconds ("12:04:05.123"), UTC ISO 8601 for
// JSON, and the monotonic clock in seconds (comparable across processes).
std::string ClockText();
std::string IsoTime();
double Monotonic();

// Database: reachable (else kDbUnavailable, with where it looked) and holding
// our tables (else kNoTables).
void RequireDatabase(bool tables);
// Rows of one statement, each a map of the named columns; throws kDbError.
std::vector<std::vector<std::string>> Query(const std::string& sql,
                                            const std::vector<const char*>& columns);
void Exec(const std::string& sql);

// The camera record of `camId`; throws kUnknownId.
Camera LoadCamera(int camId);
bool IsOnvif(const Camera& camera);

struct ApiDeleter {
    void operator()(CameraAPI* api) const { releaseCameraAPI(api); }
};
using Api = std::unique_ptr<CameraAPI, ApiDeleter>;
// The control object the snapshot code would make for this record.
Api MakeApi(const Camera& camera);
// Throws the error of the camera's last failed call: kCameraAbsent,
// kCameraAuth or kCameraRefused, naming the camera and `what` failed.
[[noreturn]] void ThrowCameraError(const Camera& camera, const std::string& what);
// The camera's preset list (position -> name); throws on failure.
std::map<int, std::string> CameraPresets(const Camera& camera);

// Name of a request type ("guard", "direct").
const char* TypeName(int type);

}  // namespace ptztool

#endif  // TOOLS_PTZPATROL_TOOL_H
