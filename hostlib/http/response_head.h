// The head of an HTTP response, read from the lines libcurl hands over: bytes
// in, status and headers out, no I/O. One exchange may carry several heads in
// turn (an interim 1xx, an authentication round): a status line starts a new
// one. Lines that come after the final head (trailers) are ignored.
//
// A head is refused (Malformed) when its status line is not "HTTP/<version>
// <3 digits>[ <reason>]", when it repeats Content-Length with another value
// (which value frames the body would then be a guess), or when its header text
// passes kMaxBytes, so memory stays bounded whatever the server sends.
#ifndef HOSTLIB_RESPONSE_HEAD_H
#define HOSTLIB_RESPONSE_HEAD_H

#include <cstddef>
#include <map>
#include <string>

class ResponseHead {
public:
    static constexpr size_t kMaxBytes = 65536;  // header text kept of one response

    // One line as received, its line end included or not.
    void Line(const char* data, size_t size);
    // The body of the latest response began, or the exchange ended: that
    // head is final, whatever its status.
    void Seal() { final_ = true; }

    // The final head is complete: a blank line ended a head whose status is
    // 200 or above and neither 401 nor 407 (libcurl answers those itself when
    // it has credentials to try), or Seal was called.
    bool Final() const { return final_; }
    bool Malformed() const { return malformed_; }
    // Status code of the latest head; 0 before a valid status line.
    int Status() const { return status_; }
    // Header value by lower-case name, blanks around it removed, folded lines
    // joined with one space; null when absent. A repeated header keeps its
    // last value.
    const std::string* Header(const std::string& lowerName) const;
    // The Content-Length text when it frames the body: null when absent or
    // when a Transfer-Encoding takes precedence.
    const std::string* ContentLength() const;
    // Bytes of the latest head's lines received so far (line ends aside); the
    // header text kept is no more than that.
    size_t Bytes() const { return bytes_; }

private:
    void Fail();

    std::map<std::string, std::string> headers_;
    std::string last_;  // name of the latest header, for folded lines
    size_t bytes_ = 0;
    int status_ = 0;
    bool final_ = false;
    bool malformed_ = false;
};

#endif  // HOSTLIB_RESPONSE_HEAD_H
