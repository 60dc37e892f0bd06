// A control object that serves a fixed snapshot location: what a camera
// layer would report for a camera whose image is at `path`.
#ifndef TESTS_SNAPSHOT_STATIC_API_H
#define TESTS_SNAPSHOT_STATIC_API_H

#include <string>

#include "host/camera.h"

class StaticApi : public CameraAPI {
public:
    StaticApi(std::string path, int type, int port = 0) : path_(std::move(path)), type_(type), port_(port) {}
    int SetReso(std::string) override { return 0; }
    int GetPresetList(std::map<int, std::string>&) override { return -1; }
    int GetSnapshotPath(std::string& path, int& port, int& type) override {
        path = path_;
        if (port_ != 0) port = port_;
        type = type_;
        return 0;
    }
    int GoPreset(int, std::string) override { return -1; }

private:
    std::string path_;
    int type_;
    int port_;
};

#endif  // TESTS_SNAPSHOT_STATIC_API_H
