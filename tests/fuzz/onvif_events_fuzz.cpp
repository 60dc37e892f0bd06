// libFuzzer target for the ONVIF event replies: the input is a camera's
// reply to PullMessages, CreatePullPointSubscription or Renew. Whatever it
// is, reading it stays within the limits of onvif_soap.h, and its messages
// applied to the guard's two event trackers give well-formed statuses.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "hostlib/camera/onvif_events.h"
#include "hostlib/camera/onvif_soap.h"

namespace {

void Check(bool ok) {
    if (!ok) abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string text(reinterpret_cast<const char*>(data), size);
    onvif::Reply reply;
    if (!reply.Parse(text)) return 0;

    size_t dropped = 0;
    std::vector<onvif::Notification> messages = reply.Notifications(&dropped);
    Check(messages.size() <= onvif::kMaxNotifications);
    for (const onvif::Notification& n : messages) {
        Check(!n.topic.empty() && n.topic.size() <= 4 * onvif::kMaxTopicChars);
        Check(n.topicNs.size() <= 4 * onvif::kMaxTopicChars);
        Check(n.source.size() <= onvif::kMaxItems && n.data.size() <= onvif::kMaxItems);
        for (const auto* items : {&n.source, &n.data})
            for (const auto& i : *items)
                Check(i.first.size() <= onvif::kMaxItemChars &&
                      i.second.size() <= onvif::kMaxItemChars);
    }
    onvif::Reply::Subscription s = reply.PullPointSubscription();
    Check(s.referenceParameters.size() <= onvif::kMaxReferenceChars);
    reply.Termination();

    const int64_t arrived = 1714979289LL * 1000000;
    onvif::EventTracker trackers[] = {onvif::EventTracker(onvif::MotionTopics()),
                                      onvif::EventTracker(onvif::DigitalInputTopics())};
    for (onvif::EventTracker& t : trackers) {
        for (const onvif::Notification& n : messages) t.Apply(n, arrived, 3600LL * 1000000);
        EVENT_STATUS e = t.Read(arrived + 1000000);
        onvif::EventInfo info = t.Info();
        Check(e.active <= 1 && info.alarms <= messages.size());
        // Never stamped later than the messages arrived, unless true now.
        int64_t stamp = int64_t{e.timestamp.tv_sec} * 1000000 + e.timestamp.tv_usec;
        Check(info.value ? stamp == arrived + 1000000 : stamp <= arrived);
        t.Lose(arrived);
        Check(!t.Info().value);
    }
    return 0;
}
