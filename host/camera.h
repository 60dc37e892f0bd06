// Camera services the library takes from the host: stored camera records,
// connection status, and per-vendor control objects.
#ifndef HOST_CAMERA_H
#define HOST_CAMERA_H

#include <map>
#include <string>

// Stored settings of one camera.
struct CameraSettings {
    int id = 0;
    std::string host;
    int port = 0;
    std::string username, password, vendor, model, channel, path, liveReso;
    int snapshotType = 1;  // user-defined camera: 1 single image, 2 multipart stream at path
};

// A camera's stored record. Load fills it from the camera table.
class Camera {
public:
    Camera() = default;
    ~Camera() = default;

    // Reads the record of camera `id`. `option` is reserved (callers pass 0).
    // 0: loaded; non-zero: no such camera, or the query failed (record unchanged).
    int Load(int id, int option);

    int GetId() const { return settings_.id; }
    int GetPort() const { return settings_.port; }
    std::string GetHost() const { return settings_.host; }
    std::string GetUsername() const { return settings_.username; }
    std::string GetPassword() const { return settings_.password; }
    std::string GetVendor() const { return settings_.vendor; }
    std::string GetModel() const { return settings_.model; }
    std::string GetCH() const { return settings_.channel; }
    std::string GetPath() const { return settings_.path; }
    std::string GetLiveReso() const { return settings_.liveReso; }

    const CameraSettings& Settings() const { return settings_; }
    void SetSettings(const CameraSettings& settings) { settings_ = settings; }

private:
    CameraSettings settings_;
};

// Control object of one camera. Made by newCameraAPI or newUserDefinedAPI,
// used by one thread for one operation, then freed with releaseCameraAPI.
// Every call blocks until the camera answered or the driver's timeout passed.
class CameraAPI {
public:
    virtual ~CameraAPI() = default;
    // Picks the stream whose resolution is `reso` ("WxH") for snapshots. 0: accepted.
    virtual int SetReso(std::string reso) = 0;
    // Fills `presets` (key: preset position, value: the camera's name). 0: filled.
    virtual int GetPresetList(std::map<int, std::string>& presets) = 0;
    // Where a still image is served: request path, port (in: the configured
    // one; out: the one to use) and type (1 single image over HTTP, 2 multipart
    // stream). 0: all three set.
    virtual int GetSnapshotPath(std::string& path, int& port, int& type) = 0;
    // Sends the camera to a preset. 0: the camera accepted the move.
    virtual int GoPreset(int position, std::string name) = 0;
};

// Control object for a camera of a known vendor; null when the vendor is not
// supported.
CameraAPI* newCameraAPI(const std::string& host, int port, const std::string& username,
                        const std::string& password, const std::string& vendor,
                        const std::string& model, const std::string& channel);

// Control object for a generic HTTP camera that serves images at `path`;
// `type` is the fetch type as decimal text ("1" or "2"). With "1", a camera
// whose record (read by Camera::Load in this process) has this host, port and
// path and snapshot type 2 is read as a multipart stream.
CameraAPI* newUserDefinedAPI(const std::string& host, int port, const std::string& username,
                             const std::string& password, const std::string& path,
                             const std::string& type);

// Frees an object from either factory; never called with null.
void releaseCameraAPI(CameraAPI* api);

// Connection status of a camera. Only 1 and 5 let the library read presets.
// The host sets statuses through hostlib/db/camera_status.h; a camera whose
// status was never set reports 1. Thread-safe.
int GetCamConnStatus(int camId);

#endif  // HOST_CAMERA_H
