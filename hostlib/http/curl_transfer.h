// One HTTP/1.1 GET (or empty POST) over libcurl's multi interface, read pull
// style: the caller asks for bytes and the transfer runs only while it waits.
// Received body bytes go straight into the caller's buffer when a read is
// waiting; the rest of a piece that does not fit is queued. With no read
// waiting, or when the queue already holds a piece, the write callback pauses
// the transfer (curl then stops reading the socket). So the queue never holds
// more than one piece of curl's receive buffer (64 KiB) and memory stays
// bounded whatever the server sends.
// Timing is one deadline of our own, checked in the poll loop: Start sets it
// the timeout ahead and RestartDeadline moves it (a stream reader gives each
// part its own time; CURLOPT_TIMEOUT could not be moved). Once it has passed,
// a call that would have to wait fails and the exchange is over, however
// slowly data still trickles in. One object per exchange, used by one thread.
#ifndef HOSTLIB_CURL_TRANSFER_H
#define HOSTLIB_CURL_TRANSFER_H

#include <chrono>
#include <memory>
#include <string>

#include "hostlib/http/response_head.h"

class CurlTransfer {
public:
    using Clock = std::chrono::steady_clock;

    struct Request {
        std::string host;
        int port = 80;
        std::string path;  // request target; a missing leading '/' is added
        std::string username, password;  // Basic or Digest when the server asks; none when empty
        int timeoutSeconds = 30;
        bool post = false;  // an empty POST instead of a GET
    };

    CurlTransfer();
    ~CurlTransfer();
    CurlTransfer(const CurlTransfer&) = delete;
    CurlTransfer& operator=(const CurlTransfer&) = delete;

    // Sets up and starts the exchange, and sets the deadline the timeout
    // from now: the connect, the request, the response headers and the body
    // reads must all complete by then.
    bool Start(const Request& request);
    // Sets the deadline the timeout from now (the exchange goes on).
    void RestartDeadline() { deadline_ = Clock::now() + timeout_; }
    // Waits for the final response's headers (after any authentication round).
    bool WaitHeaders();
    int Status() const { return head_.Status(); }
    // Final response header by lower-case name; null when absent.
    const std::string* Header(const std::string& lowerName) const {
        return head_.Header(lowerName);
    }
    // Its Content-Length when that frames the body (see ResponseHead).
    const std::string* ContentLength() const { return head_.ContentLength(); }

    // Reads body bytes into `dst`. With `fill`, returns once `size` bytes are
    // stored, the body has ended, or an error occurred; otherwise once at
    // least one byte is stored. Result: bytes stored, 0 at the end of the
    // body, -1 on error (transport error, or the deadline passed first).
    long Read(char* dst, size_t size, bool fill);

private:
    struct Curl;

    static size_t OnHeader(char* data, size_t size, size_t count, void* self);
    static size_t OnBody(char* data, size_t size, size_t count, void* self);
    // Waits for activity (at most until `deadline`), then runs the transfer
    // once. false: the transfer failed or the deadline passed.
    bool Pump(Clock::time_point deadline);
    size_t Queued() const { return queue_.size() - queueHead_; }

    std::unique_ptr<Curl> curl_;
    std::chrono::seconds timeout_{30};
    Clock::time_point deadline_;
    bool started_ = false;
    bool failed_ = false;
    bool done_ = false;      // the transfer finished (see doneOk_)
    bool doneOk_ = false;
    bool headersDone_ = false;
    bool paused_ = false;
    bool kick_ = false;  // the next Pump runs the transfer without waiting
    ResponseHead head_;

    std::string queue_;      // body bytes received while no read waited for them
    size_t queueHead_ = 0;
    char* target_ = nullptr; // the waiting read's free space
    size_t targetLeft_ = 0;
};

#endif  // HOSTLIB_CURL_TRANSFER_H
