// Connection status of cameras, as the host knows it.
//
// The host's connection monitor reports each camera's status here; the
// library reads it through GetCamConnStatus (host/camera.h) and reads a
// camera's presets only when it is CAM_CONN_ONLINE (1) or CAM_CONN_ONLINE_PTZ (5).
// A camera whose status was never set reports CAM_CONN_ONLINE: without a
// monitor, cameras are assumed reachable and every call to them is bounded by
// the driver's timeout.
#ifndef HOSTLIB_CAMERA_STATUS_H
#define HOSTLIB_CAMERA_STATUS_H

enum CamConnStatus {
    CAM_CONN_OFFLINE = 0,
    CAM_CONN_ONLINE = 1,
    CAM_CONN_CONNECTING = 2,
    CAM_CONN_AUTH_FAILED = 3,
    CAM_CONN_DISABLED = 4,
    CAM_CONN_ONLINE_PTZ = 5,
};

// Sets the status of a camera (thread-safe).
void HostSetCamConnStatus(int camId, int status);
// Forgets every status set, so all cameras report CAM_CONN_ONLINE again.
void HostResetCamConnStatus();

#endif  // HOSTLIB_CAMERA_STATUS_H
