// ONVIF event sources driven by one hub thread over libcurl's multi
// interface (see onvif_events.h).
#include "hostlib/camera/onvif_events.h"

#include <curl/curl.h>
#include <errno.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/random.h>
#include <sys/time.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>
#include <set>

#include "common/worker_thread.h"
#include "hostlib/http/curl_global.h"

namespace onvif {

// What the hub thread and the source's users share; every field under mu.
struct EventSource::Shared {
    mutable std::mutex mu;
    EventTracker first, second;
    EventSourceStatus status;  // its first and second come from the trackers
};

namespace {

using Steady = std::chrono::steady_clock;
using Ms = std::chrono::milliseconds;
using Shared = EventSource::Shared;

constexpr size_t kMaxReply = 128 * 1024;
constexpr int kMessageLimit = 32;
constexpr long kConnectTimeoutMs = 3000;
constexpr int64_t kPullSlackMs = 5000;           // HTTP timeout of a pull beyond its own
constexpr int64_t kOffsetToleranceUs = 2000000;  // clock offset refreshed beyond this
constexpr int64_t kMinGrantedMs = 2000;

int64_t WallMicros() {
    struct timeval tv;
    gettimeofday(&tv, nullptr);
    return static_cast<int64_t>(tv.tv_sec) * 1000000 + tv.tv_usec;
}

int64_t MsUntil(Steady::time_point t, Steady::time_point now) {
    return std::chrono::duration_cast<Ms>(t - now).count();
}

// A request's answer. kRefused: an HTTP answer that is not a good SOAP reply.
enum class Outcome { kOk, kTransport, kRefused };

class Session;

}  // namespace

struct EventHub::Impl {
    // Guarded by mu.
    std::mutex mu;
    std::condition_variable acked;
    struct Add {
        uint64_t id;
        EventSourceOptions options;
        std::shared_ptr<Shared> shared;
    };
    std::vector<Add> adds;
    std::vector<uint64_t> stops;
    std::set<uint64_t> stopped;  // Stop requests done, until their caller takes them
    bool quit = false;
    bool running = false;  // the thread takes requests
    // What the sources read changed (EventHub::Changes); written by the hub thread.
    std::atomic<uint64_t> changes{0};
    uint64_t nextId = 1;

    // Set up by the constructor; used by the hub thread only (Wake by any).
    CURLM* multi = nullptr;
    int epoll = -1;  // curl's sockets and wake
    int wake = -1;   // eventfd: requests are waiting
    bool started = false;
    pthread_t thread;
    // Hub thread only.
    std::map<uint64_t, std::unique_ptr<Session>> sessions;
    Steady::time_point curlTimer = Steady::time_point::max();  // when curl wants to run

    void Wake() {
        uint64_t one = 1;
        if (write(wake, &one, sizeof one) < 0) {
            // The counter is full: the thread is woken anyway.
        }
    }
    static void* Main(void* self);
    void Loop();
    static int OnSocket(CURL*, curl_socket_t s, int what, void* self, void* known);
    static int OnTimer(CURLM*, long ms, void* self);
};

namespace {

// One camera's dialogue; lives on the hub thread only.
class Session {
public:
    Session(CURLM* multi, const EventSourceOptions& o, std::shared_ptr<Shared> shared,
            std::atomic<uint64_t>* changes)
        : multi_(multi), o_(o), shared_(std::move(shared)), changes_(changes) {
        o_.subscriptionSeconds = std::max(o_.subscriptionSeconds, 2);
        o_.pullSeconds = std::max(o_.pullSeconds, 1);
        o_.retryMinMs = std::max(o_.retryMinMs, 1);
        o_.retryMaxMs = std::max(o_.retryMaxMs, o_.retryMinMs);
        o_.callTimeoutMs = std::max(o_.callTimeoutMs, 100);
        o_.stopTimeoutMs = std::max(o_.stopTimeoutMs, 1);
        wakeAt_ = Steady::now();  // the first timer begins the dialogue
    }

    ~Session() {
        Abort();
        if (curl_) curl_easy_cleanup(curl_);
    }

    bool Busy() const { return step_ != Step::kNone; }
    bool Finished() const { return finished_; }
    Steady::time_point WakeAt() const { return wakeAt_; }
    int StopTimeoutMs() const { return o_.stopTimeoutMs; }

    void OnTimer() {
        wakeAt_ = Steady::time_point::max();
        switch (next_) {
            case Next::kBegin:
                return Begin();
            case Next::kSubscribe:
                return Subscribe();
            case Next::kPull:
                return Pull();
        }
    }

    // The source stops: the transfer in progress is dropped, a live
    // subscription is unsubscribed, best effort.
    void Stop() {
        if (stopping_) return;
        stopping_ = true;
        Abort();
        wakeAt_ = Steady::time_point::max();
        {
            std::lock_guard<std::mutex> lock(shared_->mu);
            shared_->first.Clear();
            shared_->second.Clear();
            shared_->status.subscribed = false;
        }
        ++*changes_;
        if (sub_.live) {
            sub_.live = false;
            OnSubscription(Step::kFinalUnsubscribe, EventCall::kUnsubscribe, sub_, 0,
                           o_.stopTimeoutMs);
        } else {
            finished_ = true;
        }
    }

    void OnDone(CURLcode rc) {
        curl_multi_remove_handle(multi_, curl_);
        curl_slist_free_all(headers_);
        headers_ = nullptr;
        const Step step = step_;
        step_ = Step::kNone;
        arrivedUs_ = WallMicros();
        arrived_ = Steady::now();

        long status = 0;
        curl_easy_getinfo(curl_, CURLINFO_RESPONSE_CODE, &status);
        Outcome outcome = Outcome::kOk;
        Reply reply;
        std::string why;
        if (rc == CURLE_WRITE_ERROR && reply_.size() >= kMaxReply) {
            outcome = Outcome::kRefused;
            why = "reply over " + std::to_string(kMaxReply / 1024) + " KiB";
        } else if (rc != CURLE_OK) {
            outcome = Outcome::kTransport;
            why = std::string("no answer (") + curl_easy_strerror(rc) + ")";
        } else if (!reply.Parse(reply_)) {
            outcome = Outcome::kRefused;
            why = "HTTP " + std::to_string(status) + ", not a SOAP reply";
        } else if (reply.IsFault()) {
            outcome = Outcome::kRefused;
            const Fault& f = reply.GetFault();
            why = "SOAP fault " + (f.subcode.empty() ? f.code : f.subcode) +
                  (f.reason.empty() ? "" : ": " + f.reason);
        } else if (status < 200 || status > 299) {
            outcome = Outcome::kRefused;
            why = "HTTP " + std::to_string(status);
        }
        // Idle sessions keep no large buffers.
        if (reply_.capacity() > 4096)
            std::string().swap(reply_);
        else
            reply_.clear();
        std::string().swap(post_);
        if (outcome == Outcome::kTransport) {
            SetReachable(false);
        } else {
            SetReachable(true);
        }
        Handle(step, outcome, reply, why);
    }

private:
    enum class Step {
        kNone,
        kTime,
        kTimeSigned,
        kServices,
        kCapabilities,
        kUnsubscribeOld,
        kSubscribe,
        kSync,
        kPull,
        kRenew,
        kFinalUnsubscribe,
    };
    enum class Next { kBegin, kSubscribe, kPull };

    struct Subscription {
        bool live = false;
        std::string address;  // as the camera gave it
        std::string path;     // on the configured host and port
        std::string references;
        Steady::time_point expiry;
        Steady::duration granted{};
    };

    static const char* StepName(Step s) {
        switch (s) {
            case Step::kTime:
            case Step::kTimeSigned:
                return "GetSystemDateAndTime";
            case Step::kServices:
                return "GetServices";
            case Step::kCapabilities:
                return "GetCapabilities";
            case Step::kUnsubscribeOld:
            case Step::kFinalUnsubscribe:
                return "Unsubscribe";
            case Step::kSubscribe:
                return "CreatePullPointSubscription";
            case Step::kSync:
                return "SetSynchronizationPoint";
            case Step::kPull:
                return "PullMessages";
            case Step::kRenew:
                return "Renew";
            case Step::kNone:
                break;
        }
        return "";
    }

    void Handle(Step step, Outcome outcome, const Reply& reply, const std::string& why) {
        if (stopping_) {
            finished_ = true;  // the final Unsubscribe: whatever its answer
            return;
        }
        const std::string error = std::string(StepName(step)) + ": " + why;
        switch (step) {
            case Step::kTime:
            case Step::kTimeSigned: {
                if (outcome == Outcome::kTransport) return Fail(outcome, error);
                std::optional<time_t> utc;
                if (outcome == Outcome::kOk) utc = reply.SystemDateAndTimeUtc();
                if (!utc &&
                    step == Step::kTime)  // many cameras answer only signed, or only unsigned
                    return Send(Step::kTimeSigned, "/onvif/device_service",
                                GetSystemDateAndTimeBody(), "", "", true, o_.callTimeoutMs);
                // The camera's seconds were truncated: its time is half a second on,
                // on average, at the middle of the exchange.
                if (utc)
                    SetOffset(static_cast<int64_t>(*utc) * 1000000 + 500000 -
                              (sentUs_ + arrivedUs_) / 2);
                return Send(Step::kServices, "/onvif/device_service", GetServicesBody(), "", "",
                            true, o_.callTimeoutMs);
            }
            case Step::kServices:
            case Step::kCapabilities: {
                if (outcome == Outcome::kTransport) return Fail(outcome, error);
                std::string events;
                if (outcome == Outcome::kOk)
                    events = step == Step::kServices ? reply.Services().events
                                                     : reply.Capabilities().events;
                if (events.empty() && step == Step::kServices)
                    return Send(Step::kCapabilities, "/onvif/device_service", GetCapabilitiesBody(),
                                "", "", true, o_.callTimeoutMs);
                auto url = ParseUrl(events);
                if (!url)
                    return Fail(Outcome::kRefused, outcome == Outcome::kOk
                                                       ? "GetCapabilities: no event service"
                                                       : error);
                eventsPath_ = url->path;
                return Subscribe();
            }
            case Step::kUnsubscribeOld:
                if (outcome == Outcome::kTransport) return Fail(outcome, error);
                return Create();
            case Step::kSubscribe: {
                if (outcome != Outcome::kOk) return Fail(outcome, error);
                Reply::Subscription s = reply.PullPointSubscription();
                std::string path;
                if (auto url = ParseUrl(s.address)) path = url->path;
                if (path.empty()) return Fail(Outcome::kRefused, error + "no address");
                sub_ = Subscription();
                sub_.live = true;
                sub_.address = s.address;
                sub_.path = path;
                sub_.references = s.referenceParameters;
                SetExpiry(s, Ms(int64_t{o_.subscriptionSeconds} * 1000), true);
                {
                    std::lock_guard<std::mutex> lock(shared_->mu);
                    shared_->status.subscribed = true;
                    ++shared_->status.subscriptions;
                }
                ++*changes_;
                return OnSubscription(Step::kSync, EventCall::kSetSynchronizationPoint, sub_, 0,
                                      o_.callTimeoutMs);
            }
            case Step::kSync:
                // Cameras without it send their Initialized states on their own.
                if (outcome == Outcome::kTransport) return Fail(outcome, error);
                return Pull();
            case Step::kRenew:
                if (outcome == Outcome::kTransport) return Fail(outcome, error);
                if (outcome == Outcome::kRefused) return Resubscribe(error, true);
                SetExpiry(reply.Termination(), Ms(int64_t{o_.subscriptionSeconds} * 1000), true);
                return Pull();
            case Step::kPull:
                if (outcome == Outcome::kTransport) return Fail(outcome, error);
                if (outcome == Outcome::kRefused) return Resubscribe(error, true);
                return Pulled(reply);
            case Step::kFinalUnsubscribe:
            case Step::kNone:
                return;
        }
    }

    // Step 1 of the dialogue.
    void Begin() {
        Send(Step::kTime, "/onvif/device_service", GetSystemDateAndTimeBody(), "", "", false,
             o_.callTimeoutMs);
    }

    // Steps 3 and 4: an old subscription still counted by the camera is
    // given back first.
    void Subscribe() {
        if (old_.live && Steady::now() < old_.expiry) {
            old_.live = false;
            return OnSubscription(Step::kUnsubscribeOld, EventCall::kUnsubscribe, old_, 0,
                                  std::min(o_.callTimeoutMs, 2000));
        }
        old_.live = false;
        Create();
    }

    void Create() {
        Send(Step::kSubscribe, eventsPath_,
             EventBody(EventCall::kCreatePullPointSubscription, o_.subscriptionSeconds), "",
             EventAction(EventCall::kCreatePullPointSubscription), true, o_.callTimeoutMs);
    }

    // Step 6: renew when due, else one long poll no longer than until then.
    void Pull() {
        const Steady::time_point now = Steady::now();
        if (now >= sub_.expiry) return Resubscribe("PullMessages: subscription expired", false);
        const Steady::time_point renewAt = sub_.expiry - sub_.granted / 2;
        if (now >= renewAt)
            return OnSubscription(Step::kRenew, EventCall::kRenew, sub_, o_.subscriptionSeconds,
                                  o_.callTimeoutMs);
        int64_t seconds = std::min<int64_t>(o_.pullSeconds, MsUntil(renewAt, now) / 1000);
        seconds = std::max<int64_t>(seconds, 1);
        pullSeconds_ = static_cast<int>(seconds);
        OnSubscription(Step::kPull, EventCall::kPullMessages, sub_, pullSeconds_,
                       seconds * 1000 + kPullSlackMs);
    }

    void Pulled(const Reply& reply) {
        SetExpiry(reply.Termination(), Steady::duration::zero(), false);
        size_t dropped = 0;
        std::vector<Notification> messages = reply.Notifications(&dropped);
        {
            std::lock_guard<std::mutex> lock(shared_->mu);
            for (const Notification& n : messages) {
                shared_->first.Apply(n, arrivedUs_, offsetUs_);
                shared_->second.Apply(n, arrivedUs_, offsetUs_);
            }
        }
        if (!messages.empty()) ++*changes_;
        failures_ = 0;
        // A camera that answers at once without messages is not pulled in a loop.
        if (messages.empty() && dropped == 0 &&
            arrived_ - sent_ < std::chrono::seconds(pullSeconds_) / 2)
            return After(Ms(1000), Next::kPull);
        Pull();
    }

    // The camera answers but the subscription is gone (a fault from a pull
    // or a renew, or it expired): subscribe again, at once the first time.
    void Resubscribe(const std::string& error, bool unsubscribe) {
        SetError(error);
        old_ = sub_;
        old_.live = unsubscribe && sub_.live;
        sub_.live = false;
        {
            std::lock_guard<std::mutex> lock(shared_->mu);
            shared_->first.Lose(WallMicros());
            shared_->second.Lose(WallMicros());
            shared_->status.subscribed = false;
        }
        ++*changes_;
        ++failures_;
        if (failures_ <= 1) return Subscribe();
        After(Backoff(), Next::kSubscribe);
    }

    // The dialogue failed: after a backoff it starts again from step 1. A
    // camera that does not answer has no events meanwhile.
    void Fail(Outcome outcome, const std::string& error) {
        if (stopping_) {  // the final Unsubscribe could not be sent
            finished_ = true;
            return;
        }
        SetError(error);
        if (sub_.live) old_ = sub_;
        sub_.live = false;
        {
            std::lock_guard<std::mutex> lock(shared_->mu);
            if (outcome == Outcome::kTransport) {
                shared_->first.Clear();
                shared_->second.Clear();
            } else {
                shared_->first.Lose(WallMicros());
                shared_->second.Lose(WallMicros());
            }
            shared_->status.subscribed = false;
        }
        ++*changes_;
        ++failures_;
        After(Backoff(), Next::kBegin);
    }

    Ms Backoff() const {
        int64_t ms = o_.retryMinMs;
        for (int i = 1; i < failures_ && ms < o_.retryMaxMs; ++i) ms *= 2;
        return Ms(std::min<int64_t>(ms, o_.retryMaxMs));
    }

    void After(Ms delay, Next next) {
        next_ = next;
        wakeAt_ = Steady::now() + delay;
    }

    // Expiry from TerminationTime minus CurrentTime of one reply (the
    // camera's clock), counted from its arrival. `grant`: the reply grants
    // a new term (create, renew), which sets the renew rhythm, `asked` when
    // it names no time; otherwise (a pull) it only tells what is left, if it does.
    void SetExpiry(const Reply::Subscription& s, Steady::duration asked, bool grant) {
        if (s.current) {
            // Whole seconds are truncated: half a second on, on average.
            int64_t sample = *s.current + (*s.current % 1000000 == 0 ? 500000 : 0) - arrivedUs_;
            if (std::llabs(sample - offsetUs_) > kOffsetToleranceUs) SetOffset(sample);
        }
        std::optional<Steady::duration> left;
        if (s.termination && s.current)
            left = std::chrono::microseconds(*s.termination - *s.current);
        else if (s.termination)
            left = std::chrono::microseconds(*s.termination - (arrivedUs_ + offsetUs_));
        if (!left && !grant) return;
        Steady::duration term = std::max<Steady::duration>(left.value_or(asked), Ms(0));
        sub_.expiry = arrived_ + term;
        // A very short grant is renewed twice a second at most.
        if (grant) sub_.granted = std::max<Steady::duration>(term, Ms(kMinGrantedMs));
    }

    void SetOffset(int64_t us) {
        offsetUs_ = us;
        std::lock_guard<std::mutex> lock(shared_->mu);
        shared_->status.clockOffsetUs = us;
    }

    void SetError(const std::string& error) {
        std::lock_guard<std::mutex> lock(shared_->mu);
        shared_->status.lastError = error;
        shared_->status.lastErrorUs = WallMicros();
    }

    void SetReachable(bool reachable) {
        std::lock_guard<std::mutex> lock(shared_->mu);
        shared_->status.reachable = reachable;
    }

    // A request on the subscription `s`.
    void OnSubscription(Step step, EventCall call, const Subscription& s, int seconds,
                        int64_t timeoutMs) {
        Send(step, s.path, EventBody(call, seconds, kMessageLimit),
             SubscriptionHeader(call, s.address, s.references), EventAction(call), true, timeoutMs);
    }

    void Send(Step step, const std::string& path, const std::string& body,
              const std::string& header, const std::string& action, bool sign, int64_t timeoutMs) {
        if (!curl_ && !(curl_ = NewHandle()))
            return Fail(Outcome::kTransport, std::string(StepName(step)) + ": no curl handle");
        UsernameToken token;
        bool signing = sign && !o_.username.empty();
        if (signing) {
            unsigned char nonce[16];
            if (getrandom(nonce, sizeof nonce, 0) != static_cast<ssize_t>(sizeof nonce))
                return Fail(Outcome::kRefused, std::string(StepName(step)) + ": no nonce");
            token.user = o_.username;
            token.password = o_.password;
            token.nonce.assign(reinterpret_cast<char*>(nonce), sizeof nonce);
            token.created = FormatUtc(static_cast<time_t>((WallMicros() + offsetUs_) / 1000000));
        }
        post_ = Envelope(body, signing ? &token : nullptr, header);
        std::string host = o_.host.find(':') != std::string::npos ? "[" + o_.host + "]" : o_.host;
        std::string url = "http://" + host + ":" + std::to_string(o_.port) + path;
        std::string type = "Content-Type: application/soap+xml; charset=utf-8; action=\"" +
                           (action.empty() ? ActionOf(body) : action) + "\"";
        headers_ = curl_slist_append(nullptr, type.c_str());
        headers_ = curl_slist_append(headers_, "Expect:");
        curl_easy_setopt(curl_, CURLOPT_URL, url.c_str());
        curl_easy_setopt(curl_, CURLOPT_POSTFIELDS, post_.c_str());
        curl_easy_setopt(curl_, CURLOPT_POSTFIELDSIZE, static_cast<long>(post_.size()));
        curl_easy_setopt(curl_, CURLOPT_HTTPHEADER, headers_);
        curl_easy_setopt(curl_, CURLOPT_TIMEOUT_MS,
                         static_cast<long>(std::max<int64_t>(timeoutMs, 1)));
        curl_easy_setopt(curl_, CURLOPT_CONNECTTIMEOUT_MS,
                         std::min<long>(kConnectTimeoutMs, std::max<int64_t>(timeoutMs, 1)));
        reply_.clear();
        step_ = step;
        sent_ = Steady::now();
        sentUs_ = WallMicros();
        if (curl_multi_add_handle(multi_, curl_) != CURLM_OK) {
            step_ = Step::kNone;
            curl_slist_free_all(headers_);
            headers_ = nullptr;
            Fail(Outcome::kTransport, std::string(StepName(step)) + ": cannot start");
        }
    }

    CURL* NewHandle() {
        CURL* c = curl_easy_init();
        if (!c) return nullptr;
        curl_easy_setopt(c, CURLOPT_PRIVATE, this);
        curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, Collect);
        curl_easy_setopt(c, CURLOPT_WRITEDATA, this);
        curl_easy_setopt(c, CURLOPT_NOSIGNAL, 1L);
        curl_easy_setopt(c, CURLOPT_NOPROXY, "*");
        if (!o_.username.empty()) {
            curl_easy_setopt(c, CURLOPT_HTTPAUTH, CURLAUTH_DIGEST | CURLAUTH_BASIC);
            curl_easy_setopt(c, CURLOPT_USERNAME, o_.username.c_str());
            curl_easy_setopt(c, CURLOPT_PASSWORD, o_.password.c_str());
        }
        return c;
    }

    static size_t Collect(char* data, size_t size, size_t n, void* self) {
        std::string& reply = static_cast<Session*>(self)->reply_;
        if (reply.size() + size * n > kMaxReply) {
            reply.resize(kMaxReply);  // marks the overflow for OnDone
            return 0;
        }
        reply.append(data, size * n);
        return size * n;
    }

    // Drops the transfer in progress, if any.
    void Abort() {
        if (step_ == Step::kNone) return;
        curl_multi_remove_handle(multi_, curl_);
        curl_slist_free_all(headers_);
        headers_ = nullptr;
        step_ = Step::kNone;
    }

    CURLM* multi_;
    EventSourceOptions o_;
    std::shared_ptr<Shared> shared_;
    std::atomic<uint64_t>* changes_;  // the hub's

    CURL* curl_ = nullptr;  // kept with its connection between requests
    curl_slist* headers_ = nullptr;
    std::string post_, reply_;
    Step step_ = Step::kNone;  // the request in flight
    Steady::time_point sent_, arrived_;
    int64_t sentUs_ = 0, arrivedUs_ = 0;  // wall clock of the same moments
    int pullSeconds_ = 1;

    Next next_ = Next::kBegin;  // what the timer starts
    Steady::time_point wakeAt_ = Steady::time_point::max();
    int failures_ = 0;  // since the last good pull
    bool stopping_ = false, finished_ = false;

    std::string eventsPath_;
    int64_t offsetUs_ = 0;  // camera clock minus ours
    Subscription sub_;      // the current subscription
    Subscription old_;      // one to give back before subscribing again
};

}  // namespace

// ---- hub ----

void* EventHub::Impl::Main(void* self) {
    static_cast<Impl*>(self)->Loop();
    return nullptr;
}

// curl's sockets are watched with epoll and driven one by one with
// curl_multi_socket_action, so a wakeup costs the sockets that are ready,
// not all of them (curl_multi_poll polls every socket of every camera).
int EventHub::Impl::OnSocket(CURL*, curl_socket_t s, int what, void* self, void* known) {
    Impl* hub = static_cast<Impl*>(self);
    if (what == CURL_POLL_REMOVE) {
        epoll_ctl(hub->epoll, EPOLL_CTL_DEL, s, nullptr);
        curl_multi_assign(hub->multi, s, nullptr);
        return 0;
    }
    struct epoll_event ev = {};
    ev.events = (what & CURL_POLL_IN ? EPOLLIN : 0u) | (what & CURL_POLL_OUT ? EPOLLOUT : 0u);
    ev.data.fd = s;
    if (epoll_ctl(hub->epoll, known ? EPOLL_CTL_MOD : EPOLL_CTL_ADD, s, &ev) != 0 &&
        errno == ENOENT)
        epoll_ctl(hub->epoll, EPOLL_CTL_ADD, s, &ev);
    curl_multi_assign(hub->multi, s, hub);  // known from now on
    return 0;
}

int EventHub::Impl::OnTimer(CURLM*, long ms, void* self) {
    static_cast<Impl*>(self)->curlTimer =
        ms < 0 ? Steady::time_point::max() : Steady::now() + Ms(ms);
    return 0;
}


void EventHub::Impl::Loop() {
    bool quitting = false;
    Steady::time_point quitDeadline;
    struct epoll_event events[64];
    int ready = 0;
    for (;;) {
        int active = 0;
        for (int i = 0; i < ready; ++i) {
            if (events[i].data.fd == wake) {
                uint64_t count;
                if (read(wake, &count, sizeof count) < 0) {
                    // Nothing to read: another wakeup took it.
                }
                continue;
            }
            int flags = (events[i].events & EPOLLIN ? CURL_CSELECT_IN : 0) |
                        (events[i].events & EPOLLOUT ? CURL_CSELECT_OUT : 0) |
                        (events[i].events & (EPOLLERR | EPOLLHUP) ? CURL_CSELECT_ERR : 0);
            curl_multi_socket_action(multi, events[i].data.fd, flags, &active);
        }

        std::vector<Add> newSessions;
        std::vector<uint64_t> newStops;
        bool quitNow;
        {
            std::lock_guard<std::mutex> lock(mu);
            newSessions.swap(adds);
            newStops.swap(stops);
            quitNow = quit;
        }
        for (Add& a : newSessions)
            sessions[a.id] =
                std::make_unique<Session>(multi, a.options, std::move(a.shared), &changes);
        if (!newStops.empty()) {
            for (uint64_t id : newStops) {
                auto it = sessions.find(id);
                if (it != sessions.end()) it->second->Stop();
            }
            std::lock_guard<std::mutex> lock(mu);
            stopped.insert(newStops.begin(), newStops.end());
            acked.notify_all();
        }
        if (quitNow && !quitting) {
            quitting = true;
            int wait = 0;
            for (auto& s : sessions) {
                s.second->Stop();
                wait = std::max(wait, s.second->StopTimeoutMs());
            }
            quitDeadline = Steady::now() + Ms(std::min(wait, 5000));
        }

        for (int round = 0; round < 2; ++round) {
            // Curl's timers (the timeouts, and a new transfer's start); a
            // session that starts a request below is run in the second round.
            if (Steady::now() >= curlTimer) {
                curlTimer = Steady::time_point::max();
                curl_multi_socket_action(multi, CURL_SOCKET_TIMEOUT, 0, &active);
            }
            int left = 0;
            while (CURLMsg* m = curl_multi_info_read(multi, &left)) {
                if (m->msg != CURLMSG_DONE) continue;
                Session* s = nullptr;
                curl_easy_getinfo(m->easy_handle, CURLINFO_PRIVATE, reinterpret_cast<char**>(&s));
                if (s) s->OnDone(m->data.result);
            }
        }
        Steady::time_point now = Steady::now();
        Steady::time_point next = now + Ms(60000);
        for (auto it = sessions.begin(); it != sessions.end();) {
            Session& s = *it->second;
            if (!s.Busy() && !s.Finished() && s.WakeAt() <= now) s.OnTimer();
            if (s.Finished()) {
                it = sessions.erase(it);
                continue;
            }
            if (!s.Busy()) next = std::min(next, s.WakeAt());
            ++it;
        }
        if (quitting && (sessions.empty() || now >= quitDeadline)) break;
        if (quitting) next = std::min(next, quitDeadline);
        next = std::min(next, curlTimer);
        int64_t waitMs = std::max<int64_t>(0, MsUntil(next, Steady::now()));
        // Round up, so a timer is not woken for just before it is due.
        if (next > Steady::now() && Steady::now() + Ms(waitMs) < next) ++waitMs;
        ready = epoll_wait(epoll, events, 64, static_cast<int>(std::min<int64_t>(waitMs, 60000)));
        if (ready < 0) ready = 0;
    }
    sessions.clear();
    std::lock_guard<std::mutex> lock(mu);
    running = false;
    acked.notify_all();
}

EventHub::EventHub() : impl_(std::make_shared<Impl>()) {
    HostCurlGlobalInit();
    Impl& h = *impl_;
    h.multi = curl_multi_init();
    h.epoll = epoll_create1(EPOLL_CLOEXEC);
    h.wake = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
    struct epoll_event ev = {};
    ev.events = EPOLLIN;
    ev.data.fd = h.wake;
    if (h.multi && h.epoll >= 0 && h.wake >= 0 &&
        epoll_ctl(h.epoll, EPOLL_CTL_ADD, h.wake, &ev) == 0) {
        curl_multi_setopt(h.multi, CURLMOPT_SOCKETFUNCTION, &Impl::OnSocket);
        curl_multi_setopt(h.multi, CURLMOPT_SOCKETDATA, &h);
        curl_multi_setopt(h.multi, CURLMOPT_TIMERFUNCTION, &Impl::OnTimer);
        curl_multi_setopt(h.multi, CURLMOPT_TIMERDATA, &h);
        h.running = true;
        h.started = StartWorkerThread(&h.thread, &Impl::Main, &h) == 0;
        if (h.started) return;
        h.running = false;
    }
    Close();
}

void EventHub::Close() {
    Impl& h = *impl_;
    if (h.multi) curl_multi_cleanup(h.multi);
    if (h.epoll >= 0) close(h.epoll);
    if (h.wake >= 0) close(h.wake);
    h.multi = nullptr;
    h.epoll = h.wake = -1;
}

uint64_t EventHub::Changes() const { return impl_->changes.load(); }

EventHub::~EventHub() {
    if (!impl_->started) {
        Close();
        return;
    }
    {
        std::lock_guard<std::mutex> lock(impl_->mu);
        impl_->quit = true;
    }
    impl_->Wake();
    pthread_join(impl_->thread, nullptr);
    Close();
}

// ---- source ----

EventSource::EventSource(EventHub& hub, const EventSourceOptions& options)
    : hub_(hub.impl_), shared_(std::make_shared<Shared>()) {
    shared_->first = EventTracker(options.first);
    shared_->second = EventTracker(options.second);
    std::lock_guard<std::mutex> lock(hub_->mu);
    if (!hub_->running || hub_->quit) {
        shared_->status.lastError = "event hub not running";
        return;
    }
    id_ = hub_->nextId++;
    hub_->adds.push_back({id_, options, shared_});
    hub_->Wake();
}

EventSource::~EventSource() { Stop(); }

void EventSource::Stop() {
    if (id_ == 0) return;
    std::unique_lock<std::mutex> lock(hub_->mu);
    if (hub_->running && !hub_->quit) {
        hub_->stops.push_back(id_);
        hub_->Wake();
        hub_->acked.wait(lock, [this] { return !hub_->running || hub_->stopped.count(id_); });
    }
    hub_->stopped.erase(id_);
    id_ = 0;
}

void EventSource::Read(EVENT_STATUS* first, EVENT_STATUS* second) const {
    const int64_t now = WallMicros();
    std::lock_guard<std::mutex> lock(shared_->mu);
    if (first) *first = shared_->first.Read(now);
    if (second) *second = shared_->second.Read(now);
}

EventSourceStatus EventSource::Status() const {
    std::lock_guard<std::mutex> lock(shared_->mu);
    EventSourceStatus s = shared_->status;
    s.first = shared_->first.Info();
    s.second = shared_->second.Info();
    return s;
}

}  // namespace onvif
