// camsim: the ONVIF event service (PullPoint subscriptions) and its control
// endpoints. The camera has a motion alarm (video source VS_1) and a digital
// input (DIN_1); raising or clearing either queues a Changed message to
// every live subscription.
//
// Service at /onvif/event_service; subscriptions at
// /onvif/events/subscription/<id> (or, with the fault event_ref_params, all at
// /onvif/events/subscription, told apart by a SubscriptionId reference
// parameter). CreatePullPointSubscription grants the asked termination (at
// most 1 h); PullMessages answers as soon as messages are queued, or at its
// timeout (at most 60 s) with none; a pull does not extend a subscription;
// Renew does; Unsubscribe ends one (a pull waiting on it answers a fault);
// SetSynchronizationPoint queues Initialized messages of both current states.
// Subscriptions not renewed expire at their termination time.
//
// Controls (no auth):
//   POST /control/event          "motion=1", "input=0" (lines or '&' apart)
//   GET  /control/subscriptions  live subscriptions (count)
//   GET  /control/events/stats   "live=N created=N renewed=N unsubscribed=N pulls=N"
//   POST /control/events/drop    forgets every subscription, as a reboot does
// Faults (POST /control/fault): event_slots=N (subscription slots, default
// 4; CreatePullPointSubscription faults when full), event_grant_s=N (grants
// at most N s), pull_fault=N (the next N pulls answer a SOAP fault),
// event_soap11=1 (event replies in SOAP 1.1), event_prefixes=1 (other
// prefixes and default namespaces in event replies), event_cell_motion=1
// (motion as tns1:RuleEngine/CellMotionDetector/Motion IsMotion),
// event_ref_params=1 (see above).
#ifndef TOOLS_CAMSIM_CAMSIM_EVENTS_H
#define TOOLS_CAMSIM_CAMSIM_EVENTS_H

#include <string>

#include "camsim.h"

namespace httplib {
class Server;
}
namespace pugi {
class xml_node;
}

namespace camsim {

extern const char* const kEventServicePath;

// "events" for the event service, "events:<path>" for a subscription, else "".
std::string EventServiceOfPath(const std::string& path);

// One request to the event service or a subscription (`service` from
// EventServiceOfPath), authenticated already. A pull may block until its timeout.
SoapReply HandleEvents(State& state, const std::string& service, const pugi::xml_node& envelope,
                       const pugi::xml_node& request);

void ServeEventControls(State& state, httplib::Server& svr);

}  // namespace camsim

#endif  // TOOLS_CAMSIM_CAMSIM_EVENTS_H
