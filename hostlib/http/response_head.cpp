#include "hostlib/http/response_head.h"

#include <cstring>

namespace {

bool IsBlank(char c) { return c == ' ' || c == '\t'; }
bool IsDigit(char c) { return c >= '0' && c <= '9'; }

std::string Trim(const char* begin, const char* end) {
    while (begin < end && IsBlank(*begin)) ++begin;
    while (end > begin && IsBlank(end[-1])) --end;
    return std::string(begin, end);
}

// The code of "HTTP/<version> <3 digits>[ <reason>]"; 0 when it is not one.
int StatusCode(const char* p, const char* end) {
    p += 5;  // "HTTP/"
    const char* version = p;
    while (p < end && (IsDigit(*p) || *p == '.')) ++p;
    if (p == version || p == end || *p != ' ') return 0;
    ++p;
    if (end - p < 3 || !IsDigit(p[0]) || !IsDigit(p[1]) || !IsDigit(p[2]) || p[0] == '0') return 0;
    if (end - p > 3 && p[3] != ' ') return 0;
    return (p[0] - '0') * 100 + (p[1] - '0') * 10 + (p[2] - '0');
}

}  // namespace

void ResponseHead::Fail() {
    malformed_ = true;
    headers_.clear();
    last_.clear();
    status_ = 0;
}

void ResponseHead::Line(const char* data, size_t size) {
    if (final_ || malformed_) return;  // trailers, or nothing more to learn
    const char* end = data + size;
    while (end > data && (end[-1] == '\n' || end[-1] == '\r')) --end;
    const size_t length = static_cast<size_t>(end - data);

    if (length >= 5 && memcmp(data, "HTTP/", 5) == 0) {
        // A new response: forget the last one.
        headers_.clear();
        last_.clear();
        bytes_ = length;
        status_ = StatusCode(data, end);
        if (status_ == 0) Fail();
        return;
    }
    if (status_ == 0) return;  // nothing before a status line counts
    bytes_ += length;
    if (bytes_ > kMaxBytes) return Fail();

    if (length == 0) {
        if (status_ >= 200 && status_ != 401 && status_ != 407) final_ = true;
        last_.clear();
        return;
    }
    if (IsBlank(data[0])) {  // a folded line continues the latest header
        std::string more = Trim(data, end);
        auto it = last_.empty() ? headers_.end() : headers_.find(last_);
        if (it != headers_.end() && !more.empty()) {
            if (last_ == "content-length") return Fail();  // a folded length is no number
            if (!it->second.empty()) it->second += ' ';
            it->second += more;
        }
        return;
    }
    const char* colon = static_cast<const char*>(memchr(data, ':', length));
    std::string name = colon ? Trim(data, colon) : std::string();
    last_.clear();
    if (name.empty()) return;  // not a header line
    for (char& c : name) c = static_cast<char>(c >= 'A' && c <= 'Z' ? c - 'A' + 'a' : c);
    std::string value = Trim(colon + 1, end);
    auto it = headers_.find(name);
    if (it != headers_.end() && name == "content-length" && it->second != value) return Fail();
    headers_[name] = std::move(value);
    last_ = std::move(name);
}

const std::string* ResponseHead::Header(const std::string& lowerName) const {
    auto it = headers_.find(lowerName);
    return it == headers_.end() ? nullptr : &it->second;
}

const std::string* ResponseHead::ContentLength() const {
    return Header("transfer-encoding") ? nullptr : Header("content-length");
}
