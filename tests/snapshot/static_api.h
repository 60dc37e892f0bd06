// A control object that serves a fixed snapshot location, a fetch through it,
// and a file's content.
#ifndef TESTS_SNAPSHOT_STATIC_API_H
#define TESTS_SNAPSHOT_STATIC_API_H

#include <fstream>
#include <sstream>
#include <string>

#include "host/camera.h"
#include "snapshot/snapshot.h"

class StaticApi : public CameraAPI {
public:
    StaticApi(std::string path, int type) : path_(std::move(path)), type_(type) {}
    int SetReso(std::string) override { return 0; }
    int GetPresetList(std::map<int, std::string>&) override { return -1; }
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

// SnapshotGet of `path` (type 1: an image, 2: a stream); the bytes, or "FAILED"
// ("FAILED, BUFFER SET" when a failure left a buffer behind).
inline std::string FetchSnapshot(int port, const std::string& path, int type, const std::string& user = "",
                                 const std::string& password = "") {
    StaticApi api(path, type);
    unsigned char* buffer = nullptr;
    int size = 0;
    int rc = SnapshotGet("127.0.0.1", port, user, password, api, "640x480", &buffer, &size);
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
