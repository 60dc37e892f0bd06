// Camera control objects (placeholder: no driver yet).
#include "host/camera.h"

CameraAPI* newCameraAPI(const std::string&, int, const std::string&, const std::string&,
                        const std::string&, const std::string&, const std::string&) {
    return nullptr;
}

CameraAPI* newUserDefinedAPI(const std::string&, int, const std::string&, const std::string&,
                             const std::string&, const std::string&) {
    return nullptr;
}

void releaseCameraAPI(CameraAPI* api) { delete api; }
