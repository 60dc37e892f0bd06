// Camera control objects: the ONVIF driver for vendor "onvif" (any case) and
// the user-defined generic HTTP camera.
#include <strings.h>

#include <map>
#include <mutex>
#include <tuple>

#include "host/camera.h"
#include "hostlib/camera/onvif_camera.h"
#include "hostlib/camera/user_defined.h"

namespace {

using StreamKey = std::tuple<std::string, int, std::string>;  // host, port, path

std::mutex gStreamsMu;
std::map<StreamKey, int>& Streams() {  // only the streams: type 2
    static auto* streams = new std::map<StreamKey, int>;
    return *streams;
}

// A generic HTTP camera without PTZ that serves images at a fixed path.
class UserDefinedCamera : public CameraAPI {
public:
    UserDefinedCamera(const std::string& path, const std::string& type)
        : path_(path),
          type_(type == "1"   ? 1
                : type == "2" ? 2
                              : -1) {}

    int SetReso(std::string) override { return 0; }
    int GetPresetList(std::map<int, std::string>&) override { return -1; }
    // The configured path; the port is left as given; type 1 (single image),
    // 2 (multipart stream) or -1 when the configured type is neither.
    int GetSnapshotPath(std::string& path, int&, int& type) override {
        path = path_;
        type = type_;
        return 0;
    }
    int GoPreset(int, std::string) override { return -1; }

private:
    std::string path_;
    int type_;
};

}  // namespace

CameraAPI* newCameraAPI(const std::string& host, int port, const std::string& username,
                        const std::string& password, const std::string& vendor,
                        const std::string& /*model*/, const std::string& channel) {
    if (strcasecmp(vendor.c_str(), "onvif") != 0) return nullptr;
    return onvif::NewOnvifCamera(host, port, username, password, channel);
}

void HostNoteSnapshotType(const std::string& host, int port, const std::string& path, int type) {
    std::lock_guard<std::mutex> lock(gStreamsMu);
    if (type == 2) {
        Streams()[StreamKey(host, port, path)] = type;
    } else {
        Streams().erase(StreamKey(host, port, path));
    }
}

CameraAPI* newUserDefinedAPI(const std::string& host, int port, const std::string& /*username*/,
                             const std::string& /*password*/, const std::string& path,
                             const std::string& type) {
    if (type == "1") {
        std::lock_guard<std::mutex> lock(gStreamsMu);
        if (Streams().count(StreamKey(host, port, path)) != 0)
            return new UserDefinedCamera(path, "2");
    }
    return new UserDefinedCamera(path, type);
}

void releaseCameraAPI(CameraAPI* api) { delete api; }
