// A fetch of a fixed snapshot location through the user-defined camera, and a
// file's content.
#ifndef TESTS_SNAPSHOT_STATIC_API_H
#define TESTS_SNAPSHOT_STATIC_API_H

#include <fstream>
#include <sstream>
#include <string>

#include "host/camera.h"
#include "snapshot/snapshot.h"

// SnapshotGet of `path` (type 1: an image, 2: a stream); the bytes, or "FAILED"
// ("FAILED, BUFFER SET" when a failure left a buffer behind).
inline std::string FetchSnapshot(int port, const std::string& path, int type, const std::string& user = "",
                                 const std::string& password = "") {
    CameraAPI* api = newUserDefinedAPI("127.0.0.1", port, user, password, path, std::to_string(type));
    unsigned char* buffer = nullptr;
    int size = 0;
    int rc = SnapshotGet("127.0.0.1", port, user, password, *api, "640x480", &buffer, &size);
    releaseCameraAPI(api);
    std::string got = rc == 0 ? std::string(reinterpret_cast<char*>(buffer), size)
                              : buffer ? "FAILED, BUFFER SET" : "FAILED";
    SnapshotFree(buffer);
    return got;
}

inline std::string FileContent(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

#endif  // TESTS_SNAPSHOT_STATIC_API_H
