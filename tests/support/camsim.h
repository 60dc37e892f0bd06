// CamSim: one camera simulator process (tools/camsim) for a test.
//
// The constructor starts the simulator on a free 127.0.0.1 port, gives it the
// presets of the options and waits until it answers; the destructor stops it
// (it also exits by itself when the test process dies). Several may run at
// once. The binary is the one built with the tests, or $PTZ_CAMSIM if set.
// Failures to start throw std::runtime_error. Each control call is bounded by
// a 5 s timeout.
//
// The simulator's camera: ONVIF device service at /onvif/device_service
// (media, PTZ services at the addresses GetServices reports), HTTP Digest or
// WS-Security credentials on everything but /control/*. Profiles
// Profile_1_main (1920x1080, PTZ), Profile_1_sub (640x360, no PTZ) on video
// source 1 and Profile_2_main (1280x720, PTZ) on video source 2. Snapshots are
// 160x90 JPEGs filled with one colour per preset token (same token, same
// bytes; grey before the first move).
#ifndef TESTS_SUPPORT_CAMSIM_H
#define TESTS_SUPPORT_CAMSIM_H

#include <sys/types.h>

#include <string>
#include <utility>
#include <vector>

class CamSim {
public:
    struct Options {
        std::string user = "admin";
        std::string password = "secret";
        // token, name
        std::vector<std::pair<std::string, std::string>> presets = {
            {"1", "Home"}, {"2", "Door"}, {"5", "Gate"}, {"9", "Yard"}};
        int port = 0;     // 0: a free one
        int threads = 0;  // connections served at once; 0: the simulator's default (32)
    };

    CamSim();
    explicit CamSim(Options options);
    ~CamSim();
    CamSim(const CamSim&) = delete;
    CamSim& operator=(const CamSim&) = delete;

    int Port() const;

    // Replaces the camera's preset list (tokens and names without tabs or newlines).
    void SetPresets(const std::vector<std::pair<std::string, std::string>>& presets);

    // Accepted GotoPreset requests in the order received; seconds on the
    // simulator's monotonic clock since it started.
    struct Move {
        std::string token;
        double seconds;
        double monotonic;  // the same moment on CLOCK_MONOTONIC, in seconds
    };
    std::vector<Move> Moves();
    void ClearMoves();
    double Now();  // the simulator's clock, same scale as Move::seconds

    // Fault injection; an empty value clears one fault. Names:
    //   "delay_ms"           every reply (not /control/*) waits that long
    //   "status"             every reply has that HTTP status and no content
    //   "refuse"             GotoPreset to this token answers a SOAP fault
    //   "snapshot_delivery"  "length" (default) | "chunked" | "close" (no length, then close)
    //   "drop_mid_body"="1"  half the body, then the connection is closed (MJPEG: in frame 2)
    //   "lie_length"="1"     Content-Length twice the body; body sent whole, then close
    //   "garbage"="1"        SOAP replies that are not XML
    //   "fault_http_status"  HTTP status of every SOAP fault (default 400/500)
    //   "http_auth_only"="1" WS-Security ignored: HTTP Digest required (401 challenge)
    //   "time_auth"="1"      GetSystemDateAndTime needs credentials
    //   "time_no_utc"="1"    GetSystemDateAndTime gives local time only
    //   "clock_skew_s"=N     the camera's clock runs N s ahead (WS-Security Created
    //                        must be within 300 s of it)
    //   "no_get_services"="1", "no_get_capabilities"="1"  the action answers a fault
    //   "alt_paths"="1"      media and PTZ services at /onvif/Media and /onvif/PTZ
    //   "internal_address"="host:port"  reported in service, snapshot and event addresses
    //   "trickle_ms"=N       the image (MJPEG: frame "trickle_frame", default 0) declares
    //                        a Content-Length of 100000, then sends one byte every N ms
    //   "snapshot_stream"="1" GetSnapshotUri gives the MJPEG stream (20 frames)
    //   events (tools/camsim/camsim_events.h): "event_slots"=N (default 4),
    //   "event_grant_s"=N, "pull_fault"=N (the next N pulls), "event_soap11"="1",
    //   "event_prefixes"="1", "event_cell_motion"="1", "event_ref_params"="1"
    void SetFault(const std::string& name, const std::string& value);
    void ClearFaults();

    // Raises (1) or clears (0) the motion alarm and the digital input:
    // "motion=1", "input=0", several joined by '&' (applied in order).
    void SetEvents(const std::string& states);
    // Event subscriptions: live now, and created, renewed, unsubscribed and
    // pulled since the start.
    struct EventStats {
        int live = 0, created = 0, renewed = 0, unsubscribed = 0, pulls = 0;
    };
    EventStats Events();
    void DropSubscriptions();  // the camera forgets them all, as after a reboot

    // Request paths (with query) of the JPEG and of the MJPEG stream (5 s, 10 frames a second).
    std::string SnapshotPath() const;
    std::string MjpegPath() const;

private:
    std::string Control(const char* method, const std::string& path, const std::string& body);

    pid_t pid_ = -1;
    int stdinFd_ = -1;
    int port_ = 0;
};

#endif  // TESTS_SUPPORT_CAMSIM_H
