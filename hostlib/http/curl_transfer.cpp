#include "hostlib/http/curl_transfer.h"

#include <curl/curl.h>

#include <algorithm>
#include <cstring>

#include "hostlib/http/curl_global.h"

struct CurlTransfer::Curl {
    CURLM* multi = nullptr;
    CURL* easy = nullptr;
    bool added = false;
    ~Curl() {
        if (added) curl_multi_remove_handle(multi, easy);
        if (easy) curl_easy_cleanup(easy);
        if (multi) curl_multi_cleanup(multi);
    }
};

namespace {

constexpr long kCurlBufferBytes = 65536;
constexpr auto kMaxPollWait = std::chrono::milliseconds(1000);

}  // namespace

CurlTransfer::CurlTransfer() = default;
CurlTransfer::~CurlTransfer() = default;

bool CurlTransfer::Start(const Request& request) {
    if (started_) return false;
    started_ = true;
    timeout_ = std::chrono::seconds(std::max(1, request.timeoutSeconds));
    deadline_ = Clock::now() + timeout_;
    HostCurlGlobalInit();

    curl_ = std::make_unique<Curl>();
    curl_->multi = curl_multi_init();
    curl_->easy = curl_easy_init();
    if (!curl_->multi || !curl_->easy) {
        failed_ = true;
        return false;
    }
    std::string host = request.host;
    if (host.find(':') != std::string::npos && host.front() != '[') host = "[" + host + "]";
    std::string path = request.path;
    if (path.empty() || path.front() != '/') path.insert(0, "/");
    std::string url = "http://" + host + ":" + std::to_string(request.port) + path;

    CURL* e = curl_->easy;
    bool ok = curl_easy_setopt(e, CURLOPT_URL, url.c_str()) == CURLE_OK;
    ok = ok && curl_easy_setopt(e, CURLOPT_NOSIGNAL, 1L) == CURLE_OK;
    ok = ok && curl_easy_setopt(e, CURLOPT_HTTP_VERSION, CURL_HTTP_VERSION_1_1) == CURLE_OK;
    ok = ok && curl_easy_setopt(e, CURLOPT_PROTOCOLS_STR, "http") == CURLE_OK;
    ok = ok && curl_easy_setopt(e, CURLOPT_FOLLOWLOCATION, 0L) == CURLE_OK;
    // Cameras are reached directly; a proxy from the environment is not used.
    ok = ok && curl_easy_setopt(e, CURLOPT_PROXY, "") == CURLE_OK;
    ok = ok && curl_easy_setopt(e, CURLOPT_BUFFERSIZE, kCurlBufferBytes) == CURLE_OK;
    ok = ok && curl_easy_setopt(e, CURLOPT_HEADERFUNCTION, &CurlTransfer::OnHeader) == CURLE_OK;
    ok = ok && curl_easy_setopt(e, CURLOPT_HEADERDATA, this) == CURLE_OK;
    ok = ok && curl_easy_setopt(e, CURLOPT_WRITEFUNCTION, &CurlTransfer::OnBody) == CURLE_OK;
    ok = ok && curl_easy_setopt(e, CURLOPT_WRITEDATA, this) == CURLE_OK;
    if (!request.username.empty()) {
        ok = ok && curl_easy_setopt(e, CURLOPT_USERNAME, request.username.c_str()) == CURLE_OK;
        ok = ok && curl_easy_setopt(e, CURLOPT_PASSWORD, request.password.c_str()) == CURLE_OK;
        ok = ok && curl_easy_setopt(e, CURLOPT_HTTPAUTH, CURLAUTH_BASIC | CURLAUTH_DIGEST) == CURLE_OK;
    }
    if (request.post) {
        ok = ok && curl_easy_setopt(e, CURLOPT_POSTFIELDSIZE, 0L) == CURLE_OK;
        ok = ok && curl_easy_setopt(e, CURLOPT_POSTFIELDS, "") == CURLE_OK;
    }
    ok = ok && curl_multi_add_handle(curl_->multi, e) == CURLM_OK;
    if (!ok) {
        failed_ = true;
        return false;
    }
    curl_->added = true;
    kick_ = true;
    return true;
}

size_t CurlTransfer::OnHeader(char* data, size_t size, size_t count, void* self) {
    auto* t = static_cast<CurlTransfer*>(self);
    size_t n = size * count;
    t->head_.Line(data, n);
    if (t->head_.Malformed()) return 0;  // curl ends the transfer with an error
    if (t->head_.Final()) t->headersDone_ = true;
    return n;
}

size_t CurlTransfer::OnBody(char* data, size_t size, size_t count, void* self) {
    auto* t = static_cast<CurlTransfer*>(self);
    size_t n = size * count;
    t->head_.Seal();
    t->headersDone_ = true;
    // curl hands the same bytes again after a pause, so take all or nothing.
    // With no read waiting (still in the headers), pause at once: curl keeps
    // the piece and hands it straight to the first read. What a waiting read
    // cannot take is queued only when the queue is empty, so the queue holds
    // at most one piece and body bytes are rarely copied twice.
    if (n > t->targetLeft_ && (t->Queued() > 0 || t->target_ == nullptr)) {
        t->paused_ = true;
        return CURL_WRITEFUNC_PAUSE;
    }
    size_t direct = std::min(n, t->targetLeft_);
    if (direct > 0) {
        memcpy(t->target_, data, direct);
        t->target_ += direct;
        t->targetLeft_ -= direct;
    }
    if (direct < n) {
        if (t->queueHead_ > 0 && t->queueHead_ >= t->queue_.size() / 2) {
            t->queue_.erase(0, t->queueHead_);
            t->queueHead_ = 0;
        }
        t->queue_.append(data + direct, n - direct);
    }
    return n;
}

bool CurlTransfer::Pump(Clock::time_point deadline) {
    // Wait for activity first (as curl's own easy loop does), except when
    // curl has work that needs no socket: just started or just unpaused.
    if (!kick_) {
        Clock::time_point now = Clock::now();
        if (now >= deadline) {
            failed_ = true;
            return false;
        }
        auto wait = std::min<Clock::duration>(deadline - now, kMaxPollWait);
        int ms = static_cast<int>(std::chrono::ceil<std::chrono::milliseconds>(wait).count());
        if (curl_multi_poll(curl_->multi, nullptr, 0, ms, nullptr) != CURLM_OK) {
            failed_ = true;
            return false;
        }
    }
    kick_ = false;
    int running = 0;
    if (curl_multi_perform(curl_->multi, &running) != CURLM_OK) {
        failed_ = true;
        return false;
    }
    int left = 0;
    while (CURLMsg* msg = curl_multi_info_read(curl_->multi, &left)) {
        if (msg->msg == CURLMSG_DONE) {
            done_ = true;
            doneOk_ = msg->data.result == CURLE_OK;
        }
    }
    return true;
}

bool CurlTransfer::WaitHeaders() {
    if (!started_ || failed_) return false;
    while (!headersDone_) {
        if (done_) {
            // Ended without a body: the last response's headers are all there is.
            if (!doneOk_ || head_.Status() == 0) failed_ = true;
            headersDone_ = !failed_;
            break;
        }
        if (!Pump(deadline_)) break;
        if (!headersDone_ && !done_ && Clock::now() >= deadline_) failed_ = true;
        if (failed_) break;
    }
    return headersDone_ && !failed_;
}

long CurlTransfer::Read(char* dst, size_t size, bool fill) {
    if (!WaitHeaders()) return -1;
    if (size == 0) return 0;
    size_t got = std::min(size, Queued());
    if (got > 0) {
        memcpy(dst, queue_.data() + queueHead_, got);
        queueHead_ += got;
        if (queueHead_ == queue_.size()) {
            queue_.clear();
            queueHead_ = 0;
        }
        if (got == size || !fill) return static_cast<long>(got);
    }
    // The queue is empty now: further bytes go straight to the caller.
    target_ = dst + got;
    targetLeft_ = size - got;
    if (paused_) {
        paused_ = false;
        curl_easy_pause(curl_->easy, CURLPAUSE_CONT);  // may deliver the held piece at once
        kick_ = true;
    }
    while (targetLeft_ > 0 && (fill || targetLeft_ == size) && !done_ && !failed_) {
        if (!Pump(deadline_)) break;
    }
    size_t stored = size - targetLeft_;
    target_ = nullptr;
    targetLeft_ = 0;
    if (failed_ || (done_ && !doneOk_)) return -1;
    return static_cast<long>(stored);
}
