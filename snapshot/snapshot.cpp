// One still image from a camera into a heap buffer: a single HTTP response
// body (fetch type 1) or the first part of a multipart stream (type 2).
#include "snapshot/snapshot.h"

#include <cerrno>
#include <climits>
#include <cstdlib>

#include "host/http.h"

namespace {

constexpr int kHttpTimeoutSeconds = 30;
constexpr int kMultipartTimeoutSeconds = 10;
constexpr int kFirstCapacity = 131072;  // body without Content-Length: first buffer size
constexpr unsigned int kPartInfoSize = 100;

int HttpBodyRead(OvHttpClient& client, unsigned char** buffer, int length) {
    if (buffer == nullptr || length == 0) return -1;
    *buffer = static_cast<unsigned char*>(malloc(length));
    if (*buffer == nullptr) return -1;
    // One read for the whole body: it returns early only when the body ended,
    // so fewer bytes than the Content-Length means a truncated image.
    int got = client.ReadData(reinterpret_cast<char*>(*buffer), length);
    if (got != length) {
        free(*buffer);
        *buffer = nullptr;
        return -1;
    }
    return 0;
}

int HttpBodyReadAll(OvHttpClient& client, unsigned char** buffer, int* size) {
    if (buffer == nullptr || size == nullptr) return -1;
    int capacity = kFirstCapacity;
    *buffer = static_cast<unsigned char*>(malloc(capacity));
    if (*buffer == nullptr) return -1;
    int filled = 0;
    for (;;) {
        int asked = capacity - filled;
        int got = client.ReadData(reinterpret_cast<char*>(*buffer) + filled, asked);
        if (got == 0) return 0;
        if (got < 0 || got > asked) break;
        filled += got;
        *size = filled;
        if (filled < capacity) continue;
        if (capacity >= kSnapshotMaxBytes) {
            // Full at the bound: the image is whole only if the body ends here.
            char probe[16];
            if (client.ReadData(probe, sizeof probe) == 0) return 0;
            break;
        }
        capacity *= 2;
        unsigned char* grown = static_cast<unsigned char*>(realloc(*buffer, capacity));
        if (grown == nullptr) break;
        *buffer = grown;
    }
    free(*buffer);
    *buffer = nullptr;
    return -1;
}

// Parses Content-Length text as strtol does in base 10. -1 when it is
// negative, out of range or above the image bound.
int ContentLength(const std::string& text) {
    errno = 0;
    long value = strtol(text.c_str(), nullptr, 10);
    if (errno == ERANGE || value < 0 || value > INT_MAX || value > kSnapshotMaxBytes) return -1;
    return static_cast<int>(value);
}

int SnapshotHttpGet(std::string host, int port, std::string username, std::string password,
                    std::string path, unsigned char** buffer, int* size) {
    if (buffer == nullptr || size == nullptr) return -1;
    *size = 0;
    *buffer = nullptr;
    OvHttpClient client(host, port, path, username, password, kHttpTimeoutSeconds);
    if (client.SendRequest(OV_HTTP_GET) != 0) return -1;
    int status = 0;
    if (client.CheckResponse(status) != 0 || status != 200) return -1;
    std::string lengthText;
    if (client.GetHttpContent(HTTP_CONTENT_LENGTH, lengthText) == 0) {
        int length = ContentLength(lengthText);
        if (length < 0) return -1;
        *size = length;
        return HttpBodyRead(client, buffer, length);
    }
    return HttpBodyReadAll(client, buffer, size);
}

int SnapshotMultipartGet(std::string host, int port, std::string username, std::string password,
                         std::string path, unsigned char** buffer, int* size) {
    if (buffer == nullptr || size == nullptr) return -1;
    *buffer = nullptr;
    *size = 0;
    MultipartFetch reader(host.c_str(), port, path.c_str(), username.c_str(), password.c_str(),
                          kMultipartTimeoutSeconds);
    unsigned int length = 0;
    char info[kPartInfoSize];
    if (reader.NextPartInfo(length, info, kPartInfoSize) != 0) return -1;
    if (length > static_cast<unsigned int>(kSnapshotMaxBytes)) return -1;
    *buffer = static_cast<unsigned char*>(malloc(length));
    if (*buffer == nullptr) return -1;
    *size = static_cast<int>(length);
    if (reader.FetchContent(*buffer, length) != 0) {
        free(*buffer);
        *buffer = nullptr;
        return -1;
    }
    return 0;
}

}  // namespace

int SnapshotGet(std::string host, int port, std::string username, std::string password,
                CameraAPI& api, std::string reso, unsigned char** buffer, int* size) {
    if (buffer == nullptr || size == nullptr) return -1;
    if (api.SetReso(reso) != 0) return -1;
    std::string path;
    int snapshotPort = port;
    int type = 0;
    if (api.GetSnapshotPath(path, snapshotPort, type) != 0) return -1;
    switch (type) {
    case 1:
        return SnapshotHttpGet(host, snapshotPort, username, password, path, buffer, size);
    case 2:
        return SnapshotMultipartGet(host, snapshotPort, username, password, path, buffer, size);
    default:
        return -1;
    }
}

void SnapshotFree(unsigned char* buffer) { free(buffer); }
