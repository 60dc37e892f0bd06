// Making a camera's control object from its stored record.
#ifndef COMMON_CAMERA_CONTROL_H
#define COMMON_CAMERA_CONTROL_H

#include <string>

#include "host/camera.h"

// newCameraAPI with the record's host, port, user name, password, vendor,
// model and channel, read in that order. Null when the vendor has no driver.
inline CameraAPI* NewCameraAPIFromRecord(const Camera& camera) {
    const std::string host = camera.GetHost();
    const int port = camera.GetPort();
    const std::string username = camera.GetUsername();
    const std::string password = camera.GetPassword();
    const std::string vendor = camera.GetVendor();
    const std::string model = camera.GetModel();
    const std::string channel = camera.GetCH();
    return newCameraAPI(host, port, username, password, vendor, model, channel);
}

#endif  // COMMON_CAMERA_CONTROL_H
