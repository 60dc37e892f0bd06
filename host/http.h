// HTTP transport the library takes from the host: a one-request client and a
// reader of multipart (MJPEG) streams. Neither type is copyable; each object
// serves one exchange and is used by one thread.
#ifndef HOST_HTTP_H
#define HOST_HTTP_H

#include <memory>
#include <string>

enum OV_HTTP_METHOD { OV_HTTP_GET = 0, OV_HTTP_POST = 1 };
enum HTTP_MAP_KEY { HTTP_CONTENT_TYPE = 0, HTTP_CONTENT_LENGTH = 1 };

// One HTTP/1.1 request to http://host:port/path, answered with the camera's
// credentials (Basic or Digest) when the server asks for them.
// `timeoutSeconds` bounds the connect, each wait for data, and the exchange
// up to the response headers; a body is read for as long as data keeps coming.
class OvHttpClient {
public:
    OvHttpClient(const std::string& host, int port, const std::string& path,
                 const std::string& username, const std::string& password, int timeoutSeconds);
    ~OvHttpClient();
    OvHttpClient(const OvHttpClient&) = delete;
    OvHttpClient& operator=(const OvHttpClient&) = delete;

    // Starts the request. 0: sent.
    int SendRequest(OV_HTTP_METHOD method);
    // Waits for the response headers. 0: a response arrived, `status` holds its code.
    int CheckResponse(int& status);
    // Text of a response header. 0: the header is present; non-zero: absent.
    int GetHttpContent(HTTP_MAP_KEY key, std::string& value);
    // Stores up to `length` body bytes. Returns only when `length` bytes are
    // stored, the body has ended, or an error occurred: the count stored (> 0),
    // 0 once the body has ended, negative on error.
    int ReadData(char* buffer, int length);

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

// Reader of a multipart/x-mixed-replace stream at http://host:port/path.
// Keeps at most one part in memory. `timeoutSeconds` bounds the connect and
// each wait for data.
class MultipartFetch {
public:
    MultipartFetch(const char* host, int port, const char* path, const char* username,
                   const char* password, int timeoutSeconds);
    ~MultipartFetch();
    MultipartFetch(const MultipartFetch&) = delete;
    MultipartFetch& operator=(const MultipartFetch&) = delete;

    // Reads the headers of the next part. 0: `length` holds the byte length of
    // its content, `info` up to `infoSize` bytes of text about it (NUL-terminated
    // when infoSize > 0).
    int NextPartInfo(unsigned int& length, char* info, unsigned int infoSize);
    // Stores `length` content bytes of the current part. 0: all stored.
    int FetchContent(unsigned char* buffer, unsigned int length);

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

#endif  // HOST_HTTP_H
