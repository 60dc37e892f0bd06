#include "hostlib/http/multipart_parser.h"

#include <algorithm>
#include <cctype>
#include <cstring>

namespace {

constexpr size_t kMaxLine = 8192;       // a delimiter or header line
constexpr size_t kMaxBoundary = 70;     // longest boundary a multipart body may use

bool IsTokenChar(unsigned char c) {
    return c > 32 && c < 127 && c != ':' && c != '(' && c != ')' && c != '<' && c != '>' &&
           c != '@' && c != ',' && c != ';' && c != '\\' && c != '"' && c != '/' && c != '[' &&
           c != ']' && c != '?' && c != '=' && c != '{' && c != '}';
}

// "Name: value" with a token name.
bool LooksLikeHeader(const std::string& line) {
    size_t i = 0;
    while (i < line.size() && IsTokenChar(static_cast<unsigned char>(line[i]))) ++i;
    return i > 0 && i < line.size() && line[i] == ':';
}

bool IsBoundaryChar(unsigned char c) {
    return std::isalnum(c) || std::strchr("'()+_,-./:=? ", c) != nullptr;
}

std::string Lower(std::string s) {
    for (char& c : s) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return s;
}

std::string TrimRight(std::string s) {
    while (!s.empty() && (s.back() == ' ' || s.back() == '\t' || s.back() == '\r')) s.pop_back();
    return s;
}

std::string Trim(const std::string& s) {
    size_t b = s.find_first_not_of(" \t");
    if (b == std::string::npos) return "";
    return TrimRight(s.substr(b));
}

// Content-Length of a header block: true with `length` when present and all
// digits; `tooBig` when it exceeds `limit`.
bool PartLength(const std::string& headers, size_t limit, size_t& length, bool& tooBig) {
    tooBig = false;
    size_t start = 0;
    while (start <= headers.size()) {
        size_t end = headers.find("\r\n", start);
        if (end == std::string::npos) end = headers.size();
        std::string line = headers.substr(start, end - start);
        size_t colon = line.find(':');
        if (colon != std::string::npos && Lower(Trim(line.substr(0, colon))) == "content-length") {
            std::string value = Trim(line.substr(colon + 1));
            if (value.empty() ||
                !std::all_of(value.begin(), value.end(), [](char c) { return c >= '0' && c <= '9'; }))
                return false;
            size_t v = 0;
            for (char c : value) {
                v = v * 10 + static_cast<size_t>(c - '0');
                if (v > limit) {
                    tooBig = true;
                    return false;
                }
            }
            length = v;
            return true;
        }
        start = end + 2;
    }
    return false;
}

}  // namespace

MultipartParser::MultipartParser(const std::string& boundary, size_t maxPart) : maxPart_(maxPart) {
    SetBoundary(boundary);
}

void MultipartParser::SetBoundary(std::string boundary) {
    boundary_ = std::move(boundary);
    delimiters_.clear();
    if (boundary_.empty()) return;
    delimiters_.push_back("--" + boundary_);
    // Some servers put the delimiter itself in the parameter ("--myboundary").
    if (boundary_.compare(0, 2, "--") == 0 && boundary_.size() > 2) delimiters_.push_back(boundary_);
}

void MultipartParser::Feed(const char* data, size_t size) {
    if (ended_ || state_ == State::kFailed || state_ == State::kEpilogue) return;
    if (pos_ > 0 && pos_ >= in_.size() / 2) {
        in_.erase(0, pos_);
        pos_ = 0;
    }
    in_.append(data, size);
}

void MultipartParser::End() { ended_ = true; }

MultipartParser::Result MultipartParser::Fail() {
    state_ = State::kFailed;
    in_.clear();
    pos_ = 0;
    content_.clear();
    content_.shrink_to_fit();
    headers_.clear();
    return Result::kError;
}

MultipartParser::Result MultipartParser::Next(MultipartPart& part) {
    for (;;) {
        bool progressed = false;
        Result r = Step(part, progressed);
        if (r != Result::kNeedMore || !progressed) {
            if (r == Result::kNeedMore && ended_) {
                // Nothing more will come: between parts is a clean end, inside one is not.
                if (state_ == State::kSeek || state_ == State::kEpilogue) return Result::kEnd;
                return Fail();
            }
            return r;
        }
    }
}

MultipartParser::Result MultipartParser::Step(MultipartPart& part, bool& progressed) {
    switch (state_) {
    case State::kSeek:
        return Seek(progressed);
    case State::kHeaders:
        return Headers(progressed);
    case State::kBody:
        return Body(part, progressed);
    case State::kEpilogue:
        return Result::kEnd;
    case State::kFailed:
        break;
    }
    return Result::kError;
}

bool MultipartParser::TakeLine(std::string& line) {
    size_t nl = in_.find('\n', pos_);
    if (nl == std::string::npos) return false;
    line.assign(in_, pos_, nl - pos_);
    if (!line.empty() && line.back() == '\r') line.pop_back();
    pos_ = nl + 1;
    return true;
}

int MultipartParser::DelimiterKind(const std::string& line) const {
    std::string l = TrimRight(line);
    for (const std::string& d : delimiters_) {
        if (l == d) return 1;
        if (l.size() == d.size() + 2 && l.compare(0, d.size(), d) == 0 &&
            l.compare(d.size(), 2, "--") == 0)
            return 2;
    }
    return 0;
}

// Before the first part and between parts: skips blank lines and junk up to a
// delimiter line, or up to a header line (a part without a delimiter before it).
// Lines longer than kMaxLine are junk whatever they hold, so the outcome does
// not depend on how the input was split.
MultipartParser::Result MultipartParser::Seek(bool& progressed) {
    std::string line;
    for (;;) {
        size_t before = pos_;
        if (!TakeLine(line)) {
            size_t pending = in_.size() - pos_;
            if (pending > kMaxLine) {  // an over-long line cannot be a delimiter: drop it
                skipped_ += pending;
                pos_ = in_.size();
                skippingLine_ = true;
                progressed = true;
                if (skipped_ > kMaxSkipBytes) return Fail();
            }
            return Result::kNeedMore;
        }
        size_t raw = pos_ - before;  // with its line break
        progressed = true;
        if (skippingLine_ || raw > kMaxLine + 1) {
            skippingLine_ = false;
            skipped_ += raw;
        } else if (int kind = DelimiterKind(line)) {
            skipped_ = 0;
            if (kind == 2) {
                state_ = State::kEpilogue;
                in_.clear();
                pos_ = 0;
                return Result::kEnd;
            }
            headers_.clear();
            headerBytes_ = 0;
            state_ = State::kHeaders;
            return Result::kNeedMore;
        } else if (boundary_.empty() && line.size() > 2 && line.compare(0, 2, "--") == 0 &&
                   TrimRight(line).size() <= kMaxBoundary + 2) {
            // The parameter named no boundary: the first delimiter line does.
            SetBoundary(TrimRight(line).substr(2));
            skipped_ = 0;
            headers_.clear();
            headerBytes_ = 0;
            state_ = State::kHeaders;
            return Result::kNeedMore;
        } else if (LooksLikeHeader(line)) {
            skipped_ = 0;
            headers_ = TrimRight(line);
            headerBytes_ = raw;
            state_ = State::kHeaders;
            return Result::kNeedMore;
        } else {
            skipped_ += raw;
        }
        if (skipped_ > kMaxSkipBytes) return Fail();
    }
}

// Header lines up to the blank line. The block is bounded in received bytes,
// so a split input fails exactly where a whole one does.
MultipartParser::Result MultipartParser::Headers(bool& progressed) {
    std::string line;
    for (;;) {
        size_t before = pos_;
        if (!TakeLine(line)) {
            if (headerBytes_ + (in_.size() - pos_) > kMaxHeaderBytes) return Fail();
            return Result::kNeedMore;
        }
        progressed = true;
        headerBytes_ += pos_ - before;
        if (headerBytes_ > kMaxHeaderBytes) return Fail();
        if (line.empty()) break;
        if (!headers_.empty()) headers_ += "\r\n";
        headers_ += TrimRight(line);
    }
    bool tooBig = false;
    lengthKnown_ = PartLength(headers_, maxPart_, length_, tooBig);
    if (tooBig) return Fail();
    content_.clear();
    if (lengthKnown_) content_.reserve(length_);
    scanFrom_ = 0;
    state_ = State::kBody;
    return Result::kNeedMore;
}

MultipartParser::Result MultipartParser::Body(MultipartPart& part, bool& progressed) {
    if (!lengthKnown_) return BodyToDelimiter(part, progressed);
    size_t take = std::min(in_.size() - pos_, length_ - content_.size());
    if (take > 0) {
        content_.append(in_, pos_, take);
        pos_ += take;
        progressed = true;
    }
    if (content_.size() < length_) return Result::kNeedMore;
    progressed = true;
    return Emit(part);
}

// A part without Content-Length ends at the line end before the next
// delimiter line. Received bytes move into content_ and are searched there;
// what follows the delimiter line goes back to the input.
MultipartParser::Result MultipartParser::BodyToDelimiter(MultipartPart& part, bool& progressed) {
    if (pos_ < in_.size()) {
        content_.append(in_, pos_, std::string::npos);
        in_.clear();
        pos_ = 0;
        progressed = true;
    }
    const size_t size = content_.size();
    size_t best = std::string::npos;  // start of the earliest delimiter line found
    size_t bestEnd = 0;               // index of its '\n'
    bool bestClose = false;
    size_t pending = std::string::npos;  // earliest candidate whose line is not complete yet

    auto check = [&](size_t at, size_t delimLen) {
        // `at` starts a line; delimLen bytes of delimiter follow. 1 valid, 0 not, -1 incomplete.
        // At the end of the stream a closing delimiter may lack its line break;
        // an opening one may not (it could be a cut-off content line).
        size_t k = at + delimLen;
        bool close = false;
        if (k < size && content_[k] == '-') {
            if (k + 1 >= size) return ended_ ? 0 : -1;
            if (content_[k + 1] != '-') return 0;
            close = true;
            k += 2;
        }
        while (k < size && (content_[k] == ' ' || content_[k] == '\t')) ++k;
        if (k < size && content_[k] == '\r') ++k;
        if (k >= size && (!ended_ || !close)) return ended_ ? 0 : -1;
        if (k < size && content_[k] != '\n') return 0;
        if (at < best) {
            best = at;
            bestEnd = k;
            bestClose = close;
        }
        return 1;
    };

    size_t maxDelim = 0;
    if (!delimiters_.empty()) {
        for (const std::string& d : delimiters_) {
            maxDelim = std::max(maxDelim, d.size());
            for (size_t at = content_.find(d, scanFrom_); at != std::string::npos && at < best;
                 at = content_.find(d, at + 1)) {
                if (at != 0 && content_[at - 1] != '\n') continue;
                int c = check(at, d.size());
                if (c == -1) pending = std::min(pending, at);
                if (c != 0) break;
            }
        }
    } else {
        // No boundary known yet: a line "--" + 1..70 boundary characters.
        maxDelim = kMaxBoundary + 4;
        for (size_t at = content_.compare(0, 2, "--") == 0 && scanFrom_ == 0
                             ? 0
                             : content_.find("\n--", scanFrom_ > 0 ? scanFrom_ - 1 : 0);
             at != std::string::npos; at = content_.find("\n--", at + 1)) {
            size_t start = content_[at] == '\n' ? at + 1 : at;
            size_t nl = content_.find('\n', start);
            size_t lineLen = (nl == std::string::npos ? size : nl) - start;
            std::string name = TrimRight(content_.substr(start + 2, std::min(lineLen, kMaxBoundary + 8) - 2));
            bool plausible = !name.empty() && name.size() <= kMaxBoundary &&
                             std::all_of(name.begin(), name.end(), [](char c) {
                                 return IsBoundaryChar(static_cast<unsigned char>(c));
                             });
            if (!plausible) {
                if (nl == std::string::npos && !ended_ && lineLen <= kMaxBoundary + 4)
                    pending = std::min(pending, start);
                continue;
            }
            if (nl == std::string::npos) {
                if (!ended_) pending = std::min(pending, start);
                break;
            }
            SetBoundary(name);
            best = start;
            bestEnd = nl;
            break;
        }
    }

    if (best != std::string::npos && (pending == std::string::npos || best < pending)) {
        std::string rest = bestEnd < size ? content_.substr(bestEnd + 1) : std::string();
        content_.resize(best);
        if (!content_.empty() && content_.back() == '\n') content_.pop_back();
        if (!content_.empty() && content_.back() == '\r') content_.pop_back();
        in_ = std::move(rest);
        pos_ = 0;
        progressed = true;
        if (content_.size() > maxPart_) return Fail();
        Result r = Emit(part);
        // The delimiter line is consumed: the next part's headers follow.
        state_ = bestClose ? State::kEpilogue : State::kHeaders;
        headerBytes_ = 0;
        if (bestClose) in_.clear();
        return r;
    }
    if (pending != std::string::npos) {
        scanFrom_ = pending;
    } else {
        scanFrom_ = size > maxDelim ? size - maxDelim : 0;
    }
    if (content_.size() > maxPart_ + maxDelim + 4 + kMaxLine) return Fail();
    return Result::kNeedMore;
}

MultipartParser::Result MultipartParser::Emit(MultipartPart& part) {
    part.headers = std::move(headers_);
    part.content = std::move(content_);
    headers_.clear();
    content_.clear();
    lengthKnown_ = false;
    length_ = 0;
    skipped_ = 0;
    scanFrom_ = 0;
    state_ = State::kSeek;
    return Result::kPart;
}

std::string MultipartBoundary(const std::string& contentType) {
    size_t i = contentType.find(';');
    while (i != std::string::npos) {
        size_t nameStart = contentType.find_first_not_of(" \t;", i);
        if (nameStart == std::string::npos) break;
        size_t eq = contentType.find('=', nameStart);
        if (eq == std::string::npos) break;
        std::string name = Lower(Trim(contentType.substr(nameStart, eq - nameStart)));
        size_t v = contentType.find_first_not_of(" \t", eq + 1);
        std::string value;
        size_t next;
        if (v != std::string::npos && contentType[v] == '"') {
            size_t close = contentType.find('"', v + 1);
            value = contentType.substr(v + 1, close == std::string::npos ? std::string::npos : close - v - 1);
            next = close == std::string::npos ? std::string::npos : contentType.find(';', close);
        } else {
            next = contentType.find(';', eq);
            value = v == std::string::npos ? "" : Trim(contentType.substr(v, next == std::string::npos ? std::string::npos : next - v));
        }
        if (name == "boundary") return value;
        i = next;
    }
    return "";
}

std::vector<MultipartPart> ParseMultipart(const std::string& stream, const std::string& boundary,
                                          MultipartParser::Result* end, size_t maxPart) {
    MultipartParser parser(boundary, maxPart);
    parser.Feed(stream.data(), stream.size());
    parser.End();
    std::vector<MultipartPart> parts;
    MultipartPart part;
    MultipartParser::Result r;
    while ((r = parser.Next(part)) == MultipartParser::Result::kPart) parts.push_back(std::move(part));
    if (end) *end = r;
    return parts;
}
