// camsim: the ONVIF event service (see camsim_events.h).
#include "camsim_events.h"

#include <httplib.h>
#include <stdio.h>
#include <string.h>
#include <sys/time.h>

#include <condition_variable>
#include <deque>
#include <map>
#include <pugixml.hpp>
#include <sstream>

namespace camsim {

const char* const kEventServicePath = "/onvif/event_service";

namespace {

const char* const kSubscriptionPath = "/onvif/events/subscription";
const size_t kMaxQueued = 1000;

using Steady = std::chrono::steady_clock;

struct Message {
    bool motion;  // else the digital input
    bool value;
    bool initialized;
    std::string utc;
};

struct Subscription {
    Steady::time_point expiry;
    std::deque<Message> queue;
};

// The event state; apart from State so that a waiting pull holds no lock
// the rest of the simulator needs.
struct Events {
    std::mutex mu;
    std::condition_variable changed;  // a message was queued or a subscription ended
    bool motion = false, input = false;
    std::map<int, Subscription> subs;
    int nextId = 1;
    long renewed = 0, unsubscribed = 0, pulls = 0;  // since the start
} gEvents;

// Drops expired subscriptions. Requires gEvents.mu.
void Purge() {
    Steady::time_point now = Steady::now();
    for (auto it = gEvents.subs.begin(); it != gEvents.subs.end();)
        it = it->second.expiry <= now ? gEvents.subs.erase(it) : std::next(it);
}

// The camera's clock ("clock_skew_s" ahead), as xs:dateTime with milliseconds.
std::string CameraUtc(State& state, int plusSeconds = 0) {
    struct timeval tv;
    gettimeofday(&tv, nullptr);
    time_t t = tv.tv_sec + atol(state.Fault("clock_skew_s").c_str()) + plusSeconds;
    struct tm tm;
    gmtime_r(&t, &tm);
    char buf[80];
    snprintf(buf, sizeof buf, "%04d-%02d-%02dT%02d:%02d:%02d.%03dZ", tm.tm_year + 1900,
             tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec,
             static_cast<int>(tv.tv_usec / 1000));
    return buf;
}

// Seconds of an xs:duration "PT<n>S" / "PT<n>M" / "PT<m>M<s>S"; `fallback` otherwise.
int DurationSeconds(const std::string& text, int fallback) {
    int m = 0, s = 0;
    char unit = 0;
    if (sscanf(text.c_str(), " PT%dM%dS", &m, &s) == 2) return m * 60 + s;
    if (sscanf(text.c_str(), " PT%d%c", &s, &unit) == 2) return unit == 'M' ? s * 60 : s;
    return fallback;
}

const char* LocalName(const char* name) {
    const char* colon = strchr(name, ':');
    return colon ? colon + 1 : name;
}

pugi::xml_node Child(const pugi::xml_node& node, const char* local) {
    for (pugi::xml_node c = node.first_child(); c; c = c.next_sibling())
        if (c.type() == pugi::node_element && strcmp(LocalName(c.name()), local) == 0) return c;
    return {};
}

struct Style {
    bool soap11, prefixes;
};

Style StyleOf(State& state) {
    return {state.Fault("event_soap11") == "1", state.Fault("event_prefixes") == "1"};
}

// A reply envelope around `inner`, whose elements use the prefixes tev, wsnt,
// tt, tns1, wsa (declared on the envelope) unless the style says otherwise.
SoapReply Envelope(const Style& style, const std::string& inner) {
    const char* soapNs = style.soap11 ? "http://schemas.xmlsoap.org/soap/envelope/"
                                      : "http://www.w3.org/2003/05/soap-envelope";
    const char* p = style.prefixes ? "SOAP-ENV" : "env";
    SoapReply r;
    r.body = std::string("<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<") + p +
             ":Envelope xmlns:" + p + "=\"" + soapNs + "\"";
    if (!style.prefixes)
        r.body +=
            " xmlns:tt=\"http://www.onvif.org/ver10/schema\""
            " xmlns:tev=\"http://www.onvif.org/ver10/events/wsdl\""
            " xmlns:wsnt=\"http://docs.oasis-open.org/wsn/b-2\""
            " xmlns:tns1=\"http://www.onvif.org/ver10/topics\""
            " xmlns:wsa=\"http://www.w3.org/2005/08/addressing\""
            " xmlns:ter=\"http://www.onvif.org/ver10/error\"";
    r.body += std::string("><") + p + ":Body>" + inner + "</" + p + ":Body></" + p + ":Envelope>\n";
    return r;
}

SoapReply Fault(State& state, const Style& style, const char* subcode, const char* reason) {
    const char* p = style.prefixes ? "SOAP-ENV" : "env";
    std::string inner;
    if (style.soap11) {
        inner = std::string("<") + p + ":Fault><faultcode>" + p +
                ":Client</faultcode><faultstring>" + reason + "</faultstring></" + p + ":Fault>";
    } else {
        inner = std::string("<") + p + ":Fault><" + p + ":Code><" + p + ":Value>" + p +
                ":Sender</" + p + ":Value><" + p + ":Subcode><" + p +
                ":Value xmlns:ter=\"http://www.onvif.org/ver10/error\">" + subcode + "</" + p +
                ":Value></" + p + ":Subcode></" + p + ":Code><" + p + ":Reason><" + p +
                ":Text xml:lang=\"en\">" + reason + "</" + p + ":Text></" + p + ":Reason></" + p +
                ":Fault>";
    }
    SoapReply r = Envelope(style, inner);
    std::string forced = state.Fault("fault_http_status");
    r.status = forced.empty() ? (style.soap11 ? 500 : 400) : atoi(forced.c_str());
    return r;
}

std::string NotificationXml(State& state, const Style& style, const Message& m) {
    bool cell = m.motion && state.Fault("event_cell_motion") == "1";
    std::string topic, source, item;
    if (!m.motion) {
        topic = "Device/Trigger/DigitalInput";
        source = "<SI Name=\"InputToken\" Value=\"DIN_1\"/>";
        item = "LogicalState";
    } else if (cell) {
        topic = "RuleEngine/CellMotionDetector/Motion";
        source =
            "<SI Name=\"VideoSourceConfigurationToken\" Value=\"VSC_1\"/>"
            "<SI Name=\"VideoAnalyticsConfigurationToken\" Value=\"VAC_1\"/>"
            "<SI Name=\"Rule\" Value=\"MyMotionDetectorRule\"/>";
        item = "IsMotion";
    } else {
        topic = "VideoSource/MotionAlarm";
        source = "<SI Name=\"Source\" Value=\"VS_1\"/>";
        item = "State";
    }
    std::string data =
        std::string("<SI Name=\"") + item + "\" Value=\"" + (m.value ? "true" : "false") + "\"/>";
    std::string op = m.initialized ? "Initialized" : "Changed";
    const char* dialect = "http://www.onvif.org/ver10/tev/topicExpression/ConcreteSet";
    std::string out;
    if (!style.prefixes) {
        auto tt = [](std::string s) {
            for (size_t i = 0; (i = s.find("<SI ", i)) != std::string::npos;)
                s.replace(i, 4, "<tt:SimpleItem ");
            return s;
        };
        out = std::string("<wsnt:NotificationMessage><wsnt:Topic Dialect=\"") + dialect +
              "\">tns1:" + topic + "</wsnt:Topic><wsnt:Message><tt:Message UtcTime=\"" + m.utc +
              "\" PropertyOperation=\"" + op + "\"><tt:Source>" + tt(source) +
              "</tt:Source><tt:Data>" + tt(data) +
              "</tt:Data></tt:Message></wsnt:Message></wsnt:NotificationMessage>";
    } else {
        // The topic's prefix is declared on the Topic element itself, the
        // ONVIF schema is the default namespace of the message.
        auto plain = [](std::string s) {
            for (size_t i = 0; (i = s.find("<SI ", i)) != std::string::npos;)
                s.replace(i, 4, "<SimpleItem ");
            return s;
        };
        out = std::string(
                  "<b2:NotificationMessage xmlns:b2=\"http://docs.oasis-open.org/wsn/b-2\">"
                  "<b2:Topic xmlns:ev7=\"http://www.onvif.org/ver10/topics\" Dialect=\"") +
              dialect + "\">ev7:" + topic +
              "</b2:Topic><b2:Message><Message xmlns=\"http://www.onvif.org/ver10/schema\" "
              "PropertyOperation=\"" +
              op + "\" UtcTime=\"" + m.utc + "\"><Source>" + plain(source) + "</Source><Data>" +
              plain(data) + "</Data></Message></b2:Message></b2:NotificationMessage>";
    }
    return out;
}

// Elements of the event service's namespace in a reply: "tev:X" or, in the
// other style, "X" under a default namespace declared on the response.
std::string Tev(const Style& style, const std::string& name) {
    return style.prefixes ? name : "tev:" + name;
}

std::string TimesXml(State& state, const Style& style, const char* ns, int left) {
    std::string cur =
        style.prefixes ? std::string(ns) + ":CurrentTime" : std::string("wsnt:CurrentTime");
    std::string term =
        style.prefixes ? std::string(ns) + ":TerminationTime" : std::string("wsnt:TerminationTime");
    std::string decl = style.prefixes
                           ? std::string(" xmlns:") + ns + "=\"http://docs.oasis-open.org/wsn/b-2\""
                           : "";
    return "<" + cur + decl + ">" + CameraUtc(state) + "</" + cur + "><" + term + decl + ">" +
           CameraUtc(state, left) + "</" + term + ">";
}

int Granted(State& state, int asked) {
    int grant = std::max(1, std::min(asked, 3600));
    int cap = atoi(state.Fault("event_grant_s").c_str());
    return cap > 0 ? std::min(grant, cap) : grant;
}

int SecondsLeft(const Subscription& s) {
    auto left = std::chrono::duration_cast<std::chrono::seconds>(s.expiry - Steady::now()).count();
    return static_cast<int>(std::max<long long>(0, left));
}

SoapReply Create(State& state, const Style& style, const pugi::xml_node& request) {
    int slots = atoi(state.Fault("event_slots").c_str());
    if (slots <= 0) slots = 4;
    int grant = Granted(
        state, DurationSeconds(Child(request, "InitialTerminationTime").text().as_string(), 60));
    bool refs = state.Fault("event_ref_params") == "1";
    int id;
    {
        std::lock_guard<std::mutex> lock(gEvents.mu);
        Purge();
        if (static_cast<int>(gEvents.subs.size()) >= slots)
            return Fault(state, style, "ter:TooManySubscriptions", "No more subscriptions");
        id = gEvents.nextId++;
        gEvents.subs[id].expiry = Steady::now() + std::chrono::seconds(grant);
    }
    std::string address = BaseAddress(state) + kSubscriptionPath;
    std::string reference;
    if (refs) {
        reference =
            "<wsa5:ReferenceParameters xmlns:wsa5=\"http://www.w3.org/2005/08/addressing\">"
            "<dom0:SubscriptionId xmlns:dom0=\"urn:camsim:events\">" +
            std::to_string(id) + "</dom0:SubscriptionId></wsa5:ReferenceParameters>";
    } else {
        address += "/" + std::to_string(id);
    }
    std::string response = Tev(style, "CreatePullPointSubscriptionResponse");
    std::string decl = style.prefixes ? " xmlns=\"http://www.onvif.org/ver10/events/wsdl\"" : "";
    return Envelope(
        style, "<" + response + decl + "><" + Tev(style, "SubscriptionReference") +
                   "><wsa5:Address xmlns:wsa5=\"http://www.w3.org/2005/08/addressing\">" + address +
                   "</wsa5:Address>" + reference + "</" + Tev(style, "SubscriptionReference") +
                   ">" + TimesXml(state, style, "n1", grant) + "</" + response + ">");
}

// pull_fault=N: this pull and the next N-1 answer a fault; the fault's value
// counts down and clears itself.
bool TakePullFault(State& state) {
    std::lock_guard<std::mutex> lock(state.mu);
    auto it = state.faults.find("pull_fault");
    if (it == state.faults.end()) return false;
    int n = atoi(it->second.c_str());
    if (n <= 1) {
        state.faults.erase(it);
    } else {
        it->second = std::to_string(n - 1);
    }
    return n >= 1;
}

// The subscription a request names; 0 when it names none.
int SubscriptionId(const std::string& service, const pugi::xml_node& envelope) {
    std::string path = service.substr(strlen("events:"));
    std::string prefix = std::string(kSubscriptionPath) + "/";
    if (path.rfind(prefix, 0) == 0) return atoi(path.c_str() + prefix.size());
    return Child(Child(envelope, "Header"), "SubscriptionId").text().as_int(0);
}

SoapReply Pull(State& state, const Style& style, int id, const pugi::xml_node& request) {
    int timeout = std::max(
        0, std::min(60, DurationSeconds(Child(request, "Timeout").text().as_string(), 10)));
    int limit = std::max(1, Child(request, "MessageLimit").text().as_int(100));
    if (TakePullFault(state)) return Fault(state, style, "ter:InvalidArgVal", "Pull refused");
    std::vector<Message> out;
    int left = 0;
    {
        std::unique_lock<std::mutex> lock(gEvents.mu);
        ++gEvents.pulls;
        auto deadline = Steady::now() + std::chrono::seconds(timeout);
        for (;;) {
            Purge();
            auto it = gEvents.subs.find(id);
            if (it == gEvents.subs.end()) {
                lock.unlock();
                return Fault(state, style, "wsrf-rw:ResourceUnknownFault", "No such subscription");
            }
            if (!it->second.queue.empty() || Steady::now() >= deadline) {
                Subscription& s = it->second;
                while (!s.queue.empty() && static_cast<int>(out.size()) < limit) {
                    out.push_back(s.queue.front());
                    s.queue.pop_front();
                }
                left = SecondsLeft(s);
                break;
            }
            gEvents.changed.wait_until(lock, std::min(deadline, it->second.expiry));
        }
    }
    std::string inner;
    for (const Message& m : out) inner += NotificationXml(state, style, m);
    std::string response = Tev(style, "PullMessagesResponse");
    std::string decl = style.prefixes ? " xmlns=\"http://www.onvif.org/ver10/events/wsdl\"" : "";
    std::string times =
        style.prefixes
            ? "<CurrentTime>" + CameraUtc(state) + "</CurrentTime><TerminationTime>" +
                  CameraUtc(state, left) + "</TerminationTime>"
            : "<tev:CurrentTime>" + CameraUtc(state) + "</tev:CurrentTime><tev:TerminationTime>" +
                  CameraUtc(state, left) + "</tev:TerminationTime>";
    return Envelope(style, "<" + response + decl + ">" + times + inner + "</" + response + ">");
}

// Queues a message to every live subscription. Requires gEvents.mu.
void Queue(const Message& m) {
    for (auto& s : gEvents.subs) {
        if (s.second.queue.size() >= kMaxQueued) s.second.queue.pop_front();
        s.second.queue.push_back(m);
    }
    gEvents.changed.notify_all();
}

}  // namespace

std::string EventServiceOfPath(const std::string& path) {
    if (path == kEventServicePath) return "events";
    if (path.rfind(kSubscriptionPath, 0) == 0) return "events:" + path;
    return "";
}

SoapReply HandleEvents(State& state, const std::string& service, const pugi::xml_node& envelope,
                       const pugi::xml_node& request) {
    Style style = StyleOf(state);
    std::string action = LocalName(request.name());
    if (service == "events") {
        if (action == "CreatePullPointSubscription") return Create(state, style, request);
        if (action == "GetServiceCapabilities")
            return Envelope(
                style,
                "<tev:GetServiceCapabilitiesResponse xmlns:tev=\"http://www.onvif.org/"
                "ver10/events/wsdl\"><tev:Capabilities WSPullPointSupport=\"true\" "
                "WSSubscriptionPolicySupport=\"false\"/></tev:GetServiceCapabilitiesResponse>");
        return Fault(state, style, "ter:ActionNotSupported", "Action not supported");
    }
    int id = SubscriptionId(service, envelope);
    if (action == "PullMessages") return Pull(state, style, id, request);
    std::lock_guard<std::mutex> lock(gEvents.mu);
    Purge();
    auto it = gEvents.subs.find(id);
    if (it == gEvents.subs.end())
        return Fault(state, style, "wsrf-rw:ResourceUnknownFault", "No such subscription");
    if (action == "Renew") {
        int grant = Granted(
            state, DurationSeconds(Child(request, "TerminationTime").text().as_string(), 60));
        it->second.expiry = Steady::now() + std::chrono::seconds(grant);
        ++gEvents.renewed;
        std::string decl = " xmlns:wsnt=\"http://docs.oasis-open.org/wsn/b-2\"";
        return Envelope(style, "<wsnt:RenewResponse" + decl + "><wsnt:TerminationTime>" +
                                   CameraUtc(state, grant) +
                                   "</wsnt:TerminationTime><wsnt:CurrentTime>" + CameraUtc(state) +
                                   "</wsnt:CurrentTime></wsnt:RenewResponse>");
    }
    if (action == "Unsubscribe") {
        gEvents.subs.erase(it);
        ++gEvents.unsubscribed;
        gEvents.changed.notify_all();
        return Envelope(
            style, "<wsnt:UnsubscribeResponse xmlns:wsnt=\"http://docs.oasis-open.org/wsn/b-2\"/>");
    }
    if (action == "SetSynchronizationPoint") {
        std::string utc = CameraUtc(state);
        for (bool motion : {true, false}) {
            Message m{motion, motion ? gEvents.motion : gEvents.input, true, utc};
            if (it->second.queue.size() >= kMaxQueued) it->second.queue.pop_front();
            it->second.queue.push_back(m);
        }
        gEvents.changed.notify_all();
        return Envelope(style,
                        "<tev:SetSynchronizationPointResponse "
                        "xmlns:tev=\"http://www.onvif.org/ver10/events/wsdl\"/>");
    }
    return Fault(state, style, "ter:ActionNotSupported", "Action not supported");
}

void ServeEventControls(State& state, httplib::Server& svr) {
    svr.Post("/control/event", [&state](const httplib::Request& req, httplib::Response& res) {
        std::string body = req.body;
        for (char& c : body)
            if (c == '&') c = '\n';
        std::istringstream in(body);
        std::string line;
        std::string utc = CameraUtc(state);
        std::lock_guard<std::mutex> lock(gEvents.mu);
        Purge();
        while (std::getline(in, line)) {
            while (!line.empty() && (line.back() == '\r' || line.back() == ' ')) line.pop_back();
            size_t eq = line.find('=');
            if (eq == std::string::npos) continue;
            std::string name = line.substr(0, eq);
            bool value = line.substr(eq + 1) == "1" || line.substr(eq + 1) == "true";
            bool* field = name == "motion"  ? &gEvents.motion
                          : name == "input" ? &gEvents.input
                                            : nullptr;
            if (!field) {
                res.status = 400;
                return;
            }
            if (*field == value) continue;
            *field = value;
            Queue({name == "motion", value, false, utc});
        }
        res.set_content("ok\n", "text/plain");
    });
    svr.Get("/control/subscriptions", [](const httplib::Request&, httplib::Response& res) {
        std::lock_guard<std::mutex> lock(gEvents.mu);
        Purge();
        res.set_content(std::to_string(gEvents.subs.size()) + "\n", "text/plain");
    });
    svr.Get("/control/events/stats", [](const httplib::Request&, httplib::Response& res) {
        std::lock_guard<std::mutex> lock(gEvents.mu);
        Purge();
        res.set_content("live=" + std::to_string(gEvents.subs.size()) +
                            " created=" + std::to_string(gEvents.nextId - 1) +
                            " renewed=" + std::to_string(gEvents.renewed) +
                            " unsubscribed=" + std::to_string(gEvents.unsubscribed) +
                            " pulls=" + std::to_string(gEvents.pulls) + "\n",
                        "text/plain");
    });
    svr.Post("/control/events/drop", [](const httplib::Request&, httplib::Response& res) {
        std::lock_guard<std::mutex> lock(gEvents.mu);
        gEvents.subs.clear();
        gEvents.changed.notify_all();
        res.set_content("ok\n", "text/plain");
    });
}

}  // namespace camsim
