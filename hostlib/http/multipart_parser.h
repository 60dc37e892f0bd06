// Parser of multipart/x-mixed-replace streams (MJPEG over HTTP): bytes in,
// parts out. No I/O: the transport feeds whatever it received, in pieces of
// any size, and takes complete parts.
//
// Accepted: a boundary from the Content-Type with or without a leading "--";
// no boundary there at all (the first delimiter line of the body names it);
// a first part with no delimiter before it; CRLF or LF line ends; parts with a
// Content-Length (exactly that many bytes) or without one (the part ends at the
// CRLF or LF before the next delimiter line).
#ifndef HOSTLIB_MULTIPART_PARSER_H
#define HOSTLIB_MULTIPART_PARSER_H

#include <cstddef>
#include <string>
#include <vector>

struct MultipartPart {
    std::string headers;  // the part's header lines, joined with "\r\n"
    std::string content;
};

class MultipartParser {
public:
    static constexpr size_t kDefaultMaxPart = 67108864;  // 64 MiB
    static constexpr size_t kMaxHeaderBytes = 16384;     // header block of one part
    static constexpr size_t kMaxSkipBytes = 1048576;     // junk before a delimiter

    enum class Result { kNeedMore, kPart, kEnd, kError };

    // `boundary`: the boundary parameter of the stream's Content-Type (see
    // MultipartBoundary), empty when it names none. A part above `maxPart`
    // bytes is an error.
    explicit MultipartParser(const std::string& boundary, size_t maxPart = kDefaultMaxPart);

    // Appends received bytes.
    void Feed(const char* data, size_t size);
    // The stream has ended: nothing more will be fed.
    void End();

    // kPart: `part` holds the next complete part. kNeedMore: feed more bytes.
    // kEnd: the stream ended (closing delimiter, or end between parts).
    // kError: malformed or oversized, or the stream ended inside a part; final.
    Result Next(MultipartPart& part);

    // The boundary in use ("" until it is known), without the leading "--".
    const std::string& Boundary() const { return boundary_; }

private:
    enum class State { kSeek, kHeaders, kBody, kEpilogue, kFailed };

    Result Step(MultipartPart& part, bool& progressed);
    Result Seek(bool& progressed);
    Result Headers(bool& progressed);
    Result Body(MultipartPart& part, bool& progressed);
    Result BodyToDelimiter(MultipartPart& part, bool& progressed);
    bool TakeLine(std::string& line);
    void SetBoundary(std::string boundary);
    // 1: `line` is an opening delimiter, 2: a closing one, 0: neither.
    int DelimiterKind(const std::string& line) const;
    Result Emit(MultipartPart& part);
    Result Fail();

    size_t maxPart_;
    std::string boundary_;
    std::vector<std::string> delimiters_;  // "--" + boundary, and the boundary itself when it starts with "--"
    State state_ = State::kSeek;
    bool ended_ = false;

    std::string in_;   // received, not yet parsed
    size_t pos_ = 0;   // parsed prefix of in_
    size_t skipped_ = 0;
    bool skippingLine_ = false;  // inside an over-long junk line

    std::string headers_;
    size_t headerBytes_ = 0;  // received bytes of the current header block
    bool lengthKnown_ = false;
    size_t length_ = 0;
    std::string content_;
    size_t scanFrom_ = 0;  // body without length: content_ before this holds no delimiter start
};

// Boundary parameter of a Content-Type value (quotes removed); "" when absent.
std::string MultipartBoundary(const std::string& contentType);

// Parses a whole stream. `end` receives the final result: kEnd for a stream
// that ended cleanly, kError otherwise. Returns the parts read before that.
std::vector<MultipartPart> ParseMultipart(const std::string& stream, const std::string& boundary,
                                          MultipartParser::Result* end = nullptr,
                                          size_t maxPart = MultipartParser::kDefaultMaxPart);

#endif  // HOSTLIB_MULTIPART_PARSER_H
