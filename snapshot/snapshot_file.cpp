// Per-camera snapshot files: /tmp/ov_snapshot_id_<camera id>.jpg holds the
// camera's latest image. Each write goes to a fresh private temp file that is
// renamed over the path, so readers see a whole image, concurrent writers
// cannot interleave, and a symlink planted at the path is replaced, not followed.
#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>

#include "common/camera_control.h"
#include "snapshot/snapshot.h"

namespace {

constexpr size_t kPathSize = 256;
constexpr const char* kSnapshotDir = "/tmp/";
constexpr const char* kSnapshotPrefix = "ov_snapshot_id_";
constexpr int kTempAttempts = 64;

void SnapshotPath(char (&path)[kPathSize], int camId) {
    memset(path, 0, sizeof path);
    snprintf(path, sizeof path, "%s%s%d.jpg", kSnapshotDir, kSnapshotPrefix, camId);
}

// Creates a new file beside `path`, exclusively (never an existing file or a
// symlink), with the mode fopen would give (0666 less the umask).
int CreateTemp(const char* path, char (&temp)[kPathSize + 64]) {
    static std::atomic<unsigned long> counter{0};
    for (int attempt = 0; attempt < kTempAttempts; ++attempt) {
        unsigned long long salt =
            static_cast<unsigned long long>(
                std::chrono::steady_clock::now().time_since_epoch().count()) ^
            (static_cast<unsigned long long>(counter.fetch_add(1)) << 40);
        snprintf(temp, sizeof temp, "%s.%ld.%llx.tmp", path, static_cast<long>(getpid()), salt);
        int fd = open(temp, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0666);
        if (fd >= 0 || errno != EEXIST) return fd;
    }
    return -1;
}

bool WriteAll(int fd, const unsigned char* data, size_t size) {
    while (size > 0) {
        ssize_t n = write(fd, data, size);
        if (n < 0) {
            if (errno == EINTR) continue;
            return false;
        }
        data += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

// Writes `size` bytes to a temp file and renames it over `path`. On failure
// the temp file is removed and `path` is left as it was.
int ReplaceFile(const char* path, const unsigned char* data, int size) {
    char temp[kPathSize + 64];
    int fd = CreateTemp(path, temp);
    if (fd < 0) return -1;
    bool ok = WriteAll(fd, data, static_cast<size_t>(size));
    if (close(fd) != 0) ok = false;
    if (ok && rename(temp, path) == 0) return 0;
    unlink(temp);
    return -1;
}

int SnapshotFileWrite(const char* path, Camera* camera) {
    CameraAPI* api = NewCameraAPIFromRecord(*camera);
    if (api == nullptr) {
        api = newUserDefinedAPI(camera->GetHost(), camera->GetPort(), camera->GetUsername(),
                                camera->GetPassword(), camera->GetPath(), "1");
    }
    if (api == nullptr) return -1;
    unsigned char* buffer = nullptr;
    int size = 0;
    int result = -1;
    if (SnapshotGet(camera->GetHost(), camera->GetPort(), camera->GetUsername(),
                    camera->GetPassword(), *api, camera->GetLiveReso(), &buffer, &size) == 0) {
        result = ReplaceFile(path, buffer, size);
    }
    if (buffer != nullptr) SnapshotFree(buffer);
    releaseCameraAPI(api);
    return result;
}

}  // namespace

int SnapshotFileGet(Camera* camera) {
    if (camera == nullptr) return -1;
    char path[kPathSize];
    SnapshotPath(path, camera->GetId());
    return SnapshotFileWrite(path, camera) == 0 ? 0 : -1;
}

int SnapshotFileDelete(int camId) {
    char path[kPathSize];
    SnapshotPath(path, camId);
    // lstat: a dangling symlink at the path is removed too (remove never
    // follows it).
    struct stat64 st;
    if (lstat64(path, &st) != 0 && errno == ENOENT) return 0;
    remove(path);
    return 0;
}
