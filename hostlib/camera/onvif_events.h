// Camera events over ONVIF for the guard: per camera, a PullPoint
// subscription whose notification messages become the two EVENT_STATUS
// values that GuardExecutor::AnalyzeSchedule reads.
//
//   onvif::EventHub hub;                  // one per process; its thread drives every source
//   onvif::EventSourceOptions o;          // host, port, credentials, topics
//   onvif::EventSource source(hub, o);    // subscribes at once and keeps at it until Stop
//   EVENT_STATUS first, second;
//   source.Read(&first, &second);         // any thread, any time; cheap
//   guard.AnalyzeSchedule(first, second, entry);
//
// EVENT_STATUS as Read gives it, per event:
//   - active 1, timestamp now: the event is true now (some source of it
//     reported true and the subscription is alive);
//   - active 1, timestamp in the past: the last moment the event was known
//     true: the camera's time of its fall, corrected by the camera's clock
//     offset (never later than when the fall was received), or the moment the
//     subscription was lost while it was true. So an event is present for
//     the guard while it is true and for the validity window after it ended,
//     and a short pulse (true then false within one pull, or between two
//     reads) is never lost. A Changed to false is a fall even when its rise
//     came before the subscription;
//   - active 0, timestamp 0: not true since the camera was (re)subscribed as
//     far as we know (an Initialized false is not a fall), the property was
//     Deleted, the camera does not answer, or the source is stopped;
//   - reserved: the number of alarms (rising edges) seen, modulo 2^32.
// Status() adds, per event, whether a state is known, its value, the alarm
// count and the time of the last change, and for the camera whether it
// answers, whether it is subscribed and the last error.
//
// Threads: one hub thread drives all subscriptions of a process with
// libcurl's multi interface, its sockets watched with epoll, so there is no
// thread nor stack per camera (hundreds of threads would reserve hundreds of
// MiB of a 32-bit host's address space), a wakeup costs only the sockets
// that are ready, and one reply is parsed at a time (transient memory does
// not grow with the number of cameras). The hub calls no user code and holds
// a source's mutex only to store what a reply said. Stop wakes the hub, which
// aborts the camera's transfer at once (no long poll is waited out); the
// Unsubscribe then runs in the hub, bounded by stopTimeoutMs.
//
// The dialogue with the camera, each request bounded in time:
//   1. GetSystemDateAndTime (unsigned, then signed if refused): the clock
//      offset that WS-Security and event times are corrected by; refreshed by
//      the CurrentTime of later replies when it is more than 2 s off.
//   2. GetServices (GetCapabilities when it names no event service): the
//      event service's path; the configured host and port are kept (NAT).
//   3. Unsubscribe of a subscription left from before, if not yet expired
//      (best effort: cameras have few subscription slots).
//   4. CreatePullPointSubscription; the subscription's address keeps its
//      path, the configured host and port are used. Its expiry is tracked as
//      TerminationTime minus CurrentTime of the same reply (camera clock),
//      from the moment the reply arrived; the camera may grant less than asked.
//   5. SetSynchronizationPoint, so the current states arrive as Initialized.
//   6. PullMessages long polls (the HTTP timeout outlasts the pull's by 5 s),
//      every message of a reply applied in order. Renew when less than half
//      the granted time is left (a pull does not extend a subscription); a
//      pull is never longer than the time until then.
// A fault or HTTP error from a pull or a renew (the camera dropped the
// subscription) means subscribe again from step 3, at once the first time;
// a camera that does not answer means from step 1 after a backoff, and its
// events read as absent meanwhile. Backoff: retryMinMs, doubling to
// retryMaxMs; reset by a successful pull. A camera that closes its
// connections is noticed at once; one that vanishes silently (powered off,
// cable pulled) when its pull's HTTP timeout runs out (pullSeconds + 5 s).
//
// Bounds: replies over 128 KiB fail; at most kMaxNotifications messages of a
// pull, kMaxSources sources per event and the item and topic lengths of
// onvif_soap.h are kept. A camera that answers pulls at once without
// messages is pulled at most once a second.
#ifndef HOSTLIB_ONVIF_EVENTS_H
#define HOSTLIB_ONVIF_EVENTS_H

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "executor/guardExecutor.h"  // EVENT_STATUS
#include "hostlib/camera/onvif_soap.h"

namespace onvif {

// Which messages feed an event.
struct EventTopic {
    // "tns1:Path/Sub" (tns1: the ONVIF topic namespace), "{uri}Path/Sub", or a
    // bare "Path/Sub" that matches the path in any namespace.
    std::string topic;
    std::string item;    // the data item holding the state: "State", "IsMotion"
    std::string source;  // "Name=Value" that the message's source must carry; "" any
};

// tns1:VideoSource/MotionAlarm (State) and tns1:RuleEngine/CellMotionDetector/Motion (IsMotion).
std::vector<EventTopic> MotionTopics();
// tns1:Device/Trigger/DigitalInput (LogicalState).
std::vector<EventTopic> DigitalInputTopics();

struct EventInfo {
    bool known = false;        // some source reported a state since (re)subscribing
    bool value = false;        // some source is true now
    unsigned long alarms = 0;  // rising edges seen (Changed to true); Initialized true is not one
    int64_t lastChangeUs = 0;  // wall time (microseconds) of the last change of value; 0 none
    int64_t lastTrueUs = 0;    // last moment known true when not true now; 0 none
};

// One event's state from the messages of its topics; a plain object, not
// thread-safe. Sources (the Source items of a message) are kept apart, at
// most kMaxSources: the event is true while any of them is.
class EventTracker {
public:
    static constexpr size_t kMaxSources = 8;

    explicit EventTracker(const std::vector<EventTopic>& topics = {});
    // Applies one message; messages must come in the order received.
    // `arrivedUs`: wall time of its receipt; `offsetUs`: camera clock minus
    // ours. true when the message matched one of the topics.
    bool Apply(const Notification& n, int64_t arrivedUs, int64_t offsetUs);
    // The subscription ended but the camera answers: states are unknown from
    // now, a source that was true was so until `nowUs`.
    void Lose(int64_t nowUs);
    // The camera does not answer or the source stopped: nothing is known
    // (the alarm count and the last change stay).
    void Clear();
    EVENT_STATUS Read(int64_t nowUs) const;
    EventInfo Info() const;

private:
    struct Topic {
        std::string ns, path, item, sourceName, sourceValue;
    };
    struct Source {
        std::string key;  // the message's source items
        bool known = false, value = false;
        int64_t lastTrueUs = 0;
    };
    std::vector<Topic> topics_;
    std::vector<Source> sources_;
    unsigned long alarms_ = 0;
    int64_t lastChangeUs_ = 0;
};

struct EventSourceOptions {
    std::string host;
    int port = 80;
    std::string username, password;  // WS-Security digest; HTTP Digest/Basic when challenged
    std::vector<EventTopic> first = MotionTopics();
    std::vector<EventTopic> second = DigitalInputTopics();
    int subscriptionSeconds = 60;  // termination time asked for
    int pullSeconds = 10;          // timeout of one PullMessages
    int callTimeoutMs = 5000;      // every other request
    int stopTimeoutMs = 500;       // the Unsubscribe when stopping
    int retryMinMs = 500, retryMaxMs = 30000;
};

struct EventSourceStatus {
    bool reachable = false;           // the camera's last reply was an HTTP answer
    bool subscribed = false;          // a subscription is live
    unsigned long subscriptions = 0;  // subscriptions created so far
    std::string lastError;            // "Call: what went wrong"; "" none yet
    int64_t lastErrorUs = 0;          // its wall time
    int64_t clockOffsetUs = 0;        // camera clock minus ours
    EventInfo first, second;
};

// Drives the event sources attached to it from one thread.
class EventHub {
public:
    EventHub();
    // Stops the sources still attached (their Unsubscribes bounded by their
    // stopTimeoutMs) and joins the thread; the sources then read as absent.
    ~EventHub();
    EventHub(const EventHub&) = delete;
    EventHub& operator=(const EventHub&) = delete;

    // Counts the changes of what the attached sources read: messages applied,
    // subscriptions made, lost or stopped. While it stays the same no
    // source's Read has changed its active flags or alarm counts, nor has its
    // Status changed whether it is subscribed or its last error, so a reader
    // of many sources can look at them only when it moved. Any thread; one
    // atomic load.
    uint64_t Changes() const;

    struct Impl;

private:
    friend class EventSource;
    void Close();
    std::shared_ptr<Impl> impl_;
};

// The events of one camera. Read and Status may be called from any thread.
class EventSource {
public:
    EventSource(EventHub& hub, const EventSourceOptions& options);
    ~EventSource();  // Stop
    EventSource(const EventSource&) = delete;
    EventSource& operator=(const EventSource&) = delete;

    // Returns once the hub has dropped the camera's transfer in progress; the
    // events read as absent from then on. Idempotent; not to be called by two
    // threads at once.
    void Stop();
    void Read(EVENT_STATUS* first, EVENT_STATUS* second) const;
    EventSourceStatus Status() const;

    struct Shared;

private:
    std::shared_ptr<EventHub::Impl> hub_;
    std::shared_ptr<Shared> shared_;
    uint64_t id_ = 0;
};

}  // namespace onvif

#endif  // HOSTLIB_ONVIF_EVENTS_H
