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
// `timeoutSeconds` bounds the whole exchange: the connect, the request, the
// response headers and the body must all have arrived within it from
// SendRequest. A call that would have to wait past that moment fails instead
// (CheckResponse -1, ReadData negative), however slowly data still comes, and
// the exchange is over. No call blocks longer than the timeout.
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
// Keeps at most one part in memory. `timeoutSeconds` bounds each part: the
// first NextPartInfo call (connect, response headers, the part's headers and
// content) and each later one (the part's headers and content) returns within
// it from its call, with -1 when the part has not arrived whole by then (the
// reader is then done), and FetchContent of that part returns by the same
// moment. A stream runs for as long as its parts come in time.
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
