// The state of one event from its notification messages (see onvif_events.h).
#include <algorithm>

#include "hostlib/camera/onvif_events.h"

namespace onvif {

std::vector<EventTopic> MotionTopics() {
    return {{"tns1:VideoSource/MotionAlarm", "State", ""},
            {"tns1:RuleEngine/CellMotionDetector/Motion", "IsMotion", ""}};
}

std::vector<EventTopic> DigitalInputTopics() {
    return {{"tns1:Device/Trigger/DigitalInput", "LogicalState", ""}};
}

namespace {

// Longest source key kept: the items of onvif_soap.h's limits fit.
constexpr size_t kMaxKeyChars = 2 * kMaxItems * (kMaxItemChars + 2);

const std::string* Item(const Notification::Items& items, const std::string& name) {
    for (const auto& i : items)
        if (i.first == name) return &i.second;
    return nullptr;
}

struct timeval Timeval(int64_t us) {
    struct timeval tv;
    tv.tv_sec = static_cast<time_t>(us / 1000000);
    tv.tv_usec = static_cast<suseconds_t>(us % 1000000);
    return tv;
}

}  // namespace

EventTracker::EventTracker(const std::vector<EventTopic>& topics) {
    for (const EventTopic& t : topics) {
        Topic topic;
        topic.item = t.item;
        const std::string& text = t.topic;
        if (text.rfind("tns1:", 0) == 0) {
            topic.ns = kNsTopics;
            topic.path = text.substr(5);
        } else if (!text.empty() && text[0] == '{' && text.find('}') != std::string::npos) {
            topic.ns = text.substr(1, text.find('}') - 1);
            topic.path = text.substr(text.find('}') + 1);
        } else {
            topic.path = text;
        }
        size_t eq = t.source.find('=');
        topic.sourceName = t.source.substr(0, eq);
        if (eq != std::string::npos) topic.sourceValue = t.source.substr(eq + 1);
        topics_.push_back(topic);
    }
}

bool EventTracker::Apply(const Notification& n, int64_t arrivedUs, int64_t offsetUs) {
    const std::string* text = nullptr;
    bool matched = false;
    for (const Topic& t : topics_) {
        if (t.path != n.topic || (!t.ns.empty() && !n.topicNs.empty() && t.ns != n.topicNs))
            continue;
        if (!t.sourceName.empty()) {
            const std::string* v = Item(n.source, t.sourceName);
            if (!v || *v != t.sourceValue) continue;
        }
        text = Item(n.data, t.item);
        if (!text && n.op != Notification::Op::kDeleted) continue;
        matched = true;
        break;
    }
    if (!matched) return false;
    std::optional<bool> value;
    if (n.op != Notification::Op::kDeleted) {
        value = ParseBool(*text);
        if (!value) return false;
    }

    // The camera's time of the message on our clock, never later than its arrival.
    int64_t at = n.utc ? std::min(*n.utc - offsetUs, arrivedUs) : arrivedUs;
    std::string key;
    for (const auto& i : n.source) key += i.first + "=" + i.second + ";";
    if (key.size() > kMaxKeyChars) key.resize(kMaxKeyChars);

    const bool before = Info().value;
    auto it = std::find_if(sources_.begin(), sources_.end(),
                           [&](const Source& s) { return s.key == key; });
    if (n.op == Notification::Op::kDeleted) {
        if (it != sources_.end()) sources_.erase(it);
    } else {
        if (it == sources_.end()) {
            if (sources_.size() >= kMaxSources) return true;  // matched, but no room to track it
            sources_.push_back(Source());
            it = sources_.end() - 1;
            it->key = key;
        }
        Source& s = *it;
        if (n.op == Notification::Op::kChanged) {
            if (*value && !s.value) ++alarms_;
            // A change to false ends a true state, also one we had not heard of.
            if (!*value && (s.value || !s.known)) s.lastTrueUs = std::max(s.lastTrueUs, at);
        }
        s.known = true;
        s.value = *value;
    }
    if (Info().value != before && n.op != Notification::Op::kInitialized) lastChangeUs_ = at;
    return true;
}

void EventTracker::Lose(int64_t nowUs) {
    for (Source& s : sources_) {
        if (s.value) s.lastTrueUs = nowUs;
        s.known = s.value = false;
    }
}

void EventTracker::Clear() { sources_.clear(); }

EVENT_STATUS EventTracker::Read(int64_t nowUs) const {
    EventInfo info = Info();
    EVENT_STATUS status = {};
    status.reserved = static_cast<int>(static_cast<unsigned int>(alarms_ & 0xffffffffu));
    if (info.value) {
        status.active = 1;
        status.timestamp = Timeval(nowUs);
    } else if (info.lastTrueUs > 0) {
        status.active = 1;
        status.timestamp = Timeval(info.lastTrueUs);
    }
    return status;
}

EventInfo EventTracker::Info() const {
    EventInfo info;
    info.alarms = alarms_;
    info.lastChangeUs = lastChangeUs_;
    int64_t lastTrue = 0;
    for (const Source& s : sources_) {
        info.known = info.known || s.known;
        info.value = info.value || s.value;
        lastTrue = std::max(lastTrue, s.lastTrueUs);
    }
    if (!info.value) info.lastTrueUs = lastTrue;
    return info;
}

}  // namespace onvif
