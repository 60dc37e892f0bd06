// Scriptable fakes of the host's OvHttpClient and MultipartFetch for unit
// tests: each object records what it was given and answers from the script
// set here. fake::Reset() clears the script and the records.
#ifndef TESTS_FAKE_FAKE_HTTP_H
#define TESTS_FAKE_FAKE_HTTP_H

#include <optional>
#include <string>
#include <vector>

namespace fake {

// What every OvHttpClient answers.
struct HttpReply {
    int sendRc = 0;                          // SendRequest
    int checkRc = 0;                         // CheckResponse
    int status = 200;
    std::optional<std::string> contentLength;  // GetHttpContent(HTTP_CONTENT_LENGTH); none: absent
    std::string body;                        // the body ReadData hands out
    long long generatedBodySize = -1;        // >= 0: a body of this many pattern bytes instead
    long long failAfter = -1;                // >= 0: ReadData fails once this many bytes were handed out

    HttpReply& SendRc(int rc) { sendRc = rc; return *this; }
    HttpReply& CheckRc(int rc) { checkRc = rc; return *this; }
    HttpReply& Code(int code) { status = code; return *this; }
    HttpReply& Length(std::string text) { contentLength = std::move(text); return *this; }
    HttpReply& Body(std::string bytes) { body = std::move(bytes); return *this; }
    HttpReply& Generated(long long size) { generatedBodySize = size; return *this; }
    HttpReply& FailAfter(long long bytes) { failAfter = bytes; return *this; }
};
void SetHttpReply(const HttpReply& reply);

// Byte i of a generated body.
inline unsigned char PatternByte(long long i) { return static_cast<unsigned char>((i * 7 + i / 251) & 0xff); }

struct HttpExchange {
    std::string host;
    int port = 0;
    std::string path, username, password;
    int timeout = 0;
    std::vector<std::string> calls;  // "SendRequest 0", "CheckResponse", "GetHttpContent 1", "ReadData <length>"
    bool destroyed = false;
};
std::vector<HttpExchange> HttpExchanges();

// What every MultipartFetch answers.
struct MultipartReply {
    int nextRc = 0;             // NextPartInfo
    unsigned int length = 0;    // part length reported
    std::string info = "Content-Type: image/jpeg";
    std::string content;        // bytes FetchContent hands out (as many as asked, pattern bytes past the end)
    int fetchRc = 0;            // FetchContent

    MultipartReply& NextRc(int rc) { nextRc = rc; return *this; }
    MultipartReply& Length(unsigned int n) { length = n; return *this; }
    MultipartReply& Content(std::string bytes) { content = std::move(bytes); return *this; }
    MultipartReply& FetchRc(int rc) { fetchRc = rc; return *this; }
};
void SetMultipartReply(const MultipartReply& reply);

struct MultipartExchange {
    std::string host;
    int port = 0;
    std::string path, username, password;
    int timeout = 0;
    std::vector<std::string> calls;  // "NextPartInfo <infoSize>", "FetchContent <length>"
    bool destroyed = false;
};
std::vector<MultipartExchange> MultipartExchanges();

}  // namespace fake

#endif  // TESTS_FAKE_FAKE_HTTP_H
