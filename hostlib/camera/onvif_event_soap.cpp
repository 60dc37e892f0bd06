// ONVIF event (PullPoint) requests and replies (see onvif_soap.h).
#include <stdio.h>
#include <string.h>
#include <strings.h>

#include <pugixml.hpp>
#include <set>

#include "hostlib/camera/onvif_soap.h"
#include "hostlib/camera/onvif_xml.h"

namespace onvif {
namespace {

using xml::Escape;
using xml::LocalName;
using xml::ResolvePrefix;
using xml::Text;
using xml::Trimmed;

const char* const kNsWsa = "http://www.w3.org/2005/08/addressing";
const char* const kNsWsa2004 = "http://schemas.xmlsoap.org/ws/2004/08/addressing";

// First element child whose local name is `local`, whatever its namespace:
// inside a notification and around the subscription's times cameras differ
// in the namespaces they use.
pugi::xml_node ChildLocal(pugi::xml_node node, const char* local) {
    for (pugi::xml_node c = node.first_child(); c; c = c.next_sibling())
        if (c.type() == pugi::node_element && strcmp(LocalName(c.name()), local) == 0) return c;
    return {};
}

pugi::xml_attribute AttributeLocal(pugi::xml_node node, const char* local) {
    for (pugi::xml_attribute a = node.first_attribute(); a; a = a.next_attribute())
        if (strcmp(LocalName(a.name()), local) == 0 && strncmp(a.name(), "xmlns", 5) != 0) return a;
    return {};
}

std::optional<int64_t> TimeOf(pugi::xml_node node) {
    if (!node) return std::nullopt;
    return ParseDateTime(Text(node));
}

std::string Cut(const char* text) {
    std::string s = text;
    if (s.size() > kMaxItemChars) s.resize(kMaxItemChars);
    return s;
}

Notification::Items SimpleItems(pugi::xml_node parent) {
    Notification::Items out;
    for (pugi::xml_node c = parent.first_child(); c && out.size() < kMaxItems;
         c = c.next_sibling()) {
        if (c.type() != pugi::node_element || strcmp(LocalName(c.name()), "SimpleItem") != 0)
            continue;
        out.emplace_back(Cut(AttributeLocal(c, "Name").value()),
                         Cut(AttributeLocal(c, "Value").value()));
    }
    return out;
}

// The namespace and path of a concrete topic expression read at `topic`.
bool ReadTopic(pugi::xml_node topic, Notification& n) {
    std::string text = Text(topic);
    if (text.empty() || text.size() > kMaxTopicChars) return false;
    n.topicNs.clear();
    n.topic.clear();
    size_t start = 0;
    for (bool root = true; start <= text.size(); root = false) {
        size_t slash = text.find('/', start);
        if (slash == std::string::npos) slash = text.size();
        std::string segment = Trimmed(text.substr(start, slash - start).c_str());
        start = slash + 1;
        std::string uri;
        size_t colon = segment.find(':');
        if (colon != std::string::npos) {
            std::string prefix = segment.substr(0, colon);
            segment = segment.substr(colon + 1);
            if (!ResolvePrefix(topic, prefix, &uri)) uri = prefix == "tns1" ? kNsTopics : "";
        }
        if (segment.empty()) return false;
        if (root) {
            n.topicNs = uri;
        } else {
            n.topic += '/';
            if (!uri.empty() && uri != n.topicNs) n.topic += "{" + uri + "}";
        }
        n.topic += segment;
        // Namespace URIs are as long as the camera likes: bound what they add.
        if (n.topic.size() > kMaxTopicChars * 4 || n.topicNs.size() > kMaxTopicChars * 4)
            return false;
        if (slash == text.size()) break;
    }
    return true;
}

// Prefixes used by element and attribute names in the subtree of `root`
// ("" for unprefixed elements). Walks without recursion.
std::set<std::string> PrefixesUsed(pugi::xml_node root) {
    std::set<std::string> out;
    pugi::xml_node n = root;
    while (n) {
        if (n.type() == pugi::node_element) {
            const char* colon = strchr(n.name(), ':');
            out.insert(colon ? std::string(n.name(), colon - n.name()) : std::string());
            for (pugi::xml_attribute a = n.first_attribute(); a; a = a.next_attribute()) {
                const char* ac = strchr(a.name(), ':');
                std::string p = ac ? std::string(a.name(), ac - a.name()) : std::string();
                if (!p.empty() && p != "xmlns" && p != "xml") out.insert(p);
            }
        }
        if (n.first_child()) {
            n = n.first_child();
            continue;
        }
        while (n && n != root && !n.next_sibling()) n = n.parent();
        if (!n || n == root) break;
        n = n.next_sibling();
    }
    return out;
}

// The element children of ReferenceParameters as text that stands on its
// own: each child declares the namespaces it uses that were declared above it.
std::string ReferenceParameters(pugi::xml_node params) {
    std::string out;
    for (pugi::xml_node c = params.first_child(); c; c = c.next_sibling()) {
        if (c.type() != pugi::node_element) continue;
        pugi::xml_document copy;
        pugi::xml_node root = copy.append_copy(c);
        for (const std::string& prefix : PrefixesUsed(root)) {
            std::string attr = prefix.empty() ? std::string("xmlns") : "xmlns:" + prefix;
            std::string uri;
            if (root.attribute(attr.c_str()) || !ResolvePrefix(c, prefix, &uri)) continue;
            root.append_attribute(attr.c_str()).set_value(uri.c_str());
        }
        struct Writer : pugi::xml_writer {
            std::string* text;
            void write(const void* data, size_t size) override {
                if (text->size() <= kMaxReferenceChars)
                    text->append(static_cast<const char*>(data), size);
            }
        } writer;
        writer.text = &out;
        root.print(writer, "", pugi::format_raw | pugi::format_no_declaration);
        if (out.size() > kMaxReferenceChars) return std::string();
    }
    return out;
}

std::string Duration(int seconds) { return "PT" + std::to_string(seconds < 1 ? 1 : seconds) + "S"; }

// Days since 1970-01-01 of a proleptic Gregorian date.
int64_t DaysFromCivil(int64_t y, int m, int d) {
    y -= m <= 2;
    const int64_t era = (y >= 0 ? y : y - 399) / 400;
    const int64_t yoe = y - era * 400;
    const int64_t doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
    const int64_t doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    return era * 146097 + doe - 719468;
}

}  // namespace

// ---- requests ----

std::string EventBody(EventCall call, int seconds, int limit) {
    const std::string tev = std::string(" xmlns:tev=\"") + kNsEvents + "\"";
    const std::string wsnt = std::string(" xmlns:wsnt=\"") + kNsWsnt + "\"";
    switch (call) {
        case EventCall::kCreatePullPointSubscription:
            return "<tev:CreatePullPointSubscription" + tev + "><tev:InitialTerminationTime>" +
                   Duration(seconds) +
                   "</tev:InitialTerminationTime></tev:CreatePullPointSubscription>";
        case EventCall::kPullMessages:
            return "<tev:PullMessages" + tev + "><tev:Timeout>" + Duration(seconds) +
                   "</tev:Timeout><tev:MessageLimit>" + std::to_string(limit < 1 ? 1 : limit) +
                   "</tev:MessageLimit></tev:PullMessages>";
        case EventCall::kSetSynchronizationPoint:
            return "<tev:SetSynchronizationPoint" + tev + "/>";
        case EventCall::kRenew:
            return "<wsnt:Renew" + wsnt + "><wsnt:TerminationTime>" + Duration(seconds) +
                   "</wsnt:TerminationTime></wsnt:Renew>";
        case EventCall::kUnsubscribe:
            return "<wsnt:Unsubscribe" + wsnt + "/>";
    }
    return "";
}

const char* EventAction(EventCall call) {
    switch (call) {
        case EventCall::kCreatePullPointSubscription:
            return "http://www.onvif.org/ver10/events/wsdl/EventPortType/"
                   "CreatePullPointSubscriptionRequest";
        case EventCall::kPullMessages:
            return "http://www.onvif.org/ver10/events/wsdl/PullPointSubscription/"
                   "PullMessagesRequest";
        case EventCall::kSetSynchronizationPoint:
            return "http://www.onvif.org/ver10/events/wsdl/PullPointSubscription/"
                   "SetSynchronizationPointRequest";
        case EventCall::kRenew:
            return "http://docs.oasis-open.org/wsn/bw-2/SubscriptionManager/RenewRequest";
        case EventCall::kUnsubscribe:
            return "http://docs.oasis-open.org/wsn/bw-2/SubscriptionManager/UnsubscribeRequest";
    }
    return "";
}

std::string SubscriptionHeader(EventCall call, const std::string& to,
                               const std::string& referenceParameters) {
    const std::string wsa = std::string(" xmlns:wsa=\"") + kNsWsa + "\"";
    return "<wsa:Action" + wsa + ">" + EventAction(call) + "</wsa:Action><wsa:To" + wsa + ">" +
           Escape(to) + "</wsa:To>" + referenceParameters;
}

// ---- replies ----

Reply::Subscription Reply::PullPointSubscription() const {
    Subscription s;
    if (!Is(kNsEvents, "CreatePullPointSubscriptionResponse")) return s;
    pugi::xml_node body = impl_->body;
    pugi::xml_node ref = ChildLocal(body, "SubscriptionReference");
    for (pugi::xml_node c = ref.first_child(); c; c = c.next_sibling()) {
        if (impl_->names.Matches(c, kNsWsa, "Address") ||
            impl_->names.Matches(c, kNsWsa2004, "Address"))
            s.address = Text(c);
        if (impl_->names.Matches(c, kNsWsa, "ReferenceParameters") ||
            impl_->names.Matches(c, kNsWsa2004, "ReferenceParameters"))
            s.referenceParameters = ReferenceParameters(c);
    }
    s.current = TimeOf(ChildLocal(body, "CurrentTime"));
    s.termination = TimeOf(ChildLocal(body, "TerminationTime"));
    return s;
}

Reply::Subscription Reply::Termination() const {
    Subscription s;
    if (!Is(kNsEvents, "PullMessagesResponse") && !Is(kNsWsnt, "RenewResponse")) return s;
    s.current = TimeOf(ChildLocal(impl_->body, "CurrentTime"));
    s.termination = TimeOf(ChildLocal(impl_->body, "TerminationTime"));
    return s;
}

std::vector<Notification> Reply::Notifications(size_t* dropped) const {
    std::vector<Notification> out;
    size_t lost = 0;
    if (Is(kNsEvents, "PullMessagesResponse")) {
        for (pugi::xml_node c = impl_->body.first_child(); c; c = c.next_sibling()) {
            if (!impl_->names.Matches(c, kNsWsnt, "NotificationMessage")) continue;
            pugi::xml_node message;
            for (pugi::xml_node m = impl_->names.Child(c, kNsWsnt, "Message").first_child(); m;
                 m = m.next_sibling())
                if (m.type() == pugi::node_element) {
                    message = m;
                    break;
                }
            Notification n;
            if (out.size() >= kMaxNotifications || !message ||
                !ReadTopic(impl_->names.Child(c, kNsWsnt, "Topic"), n)) {
                ++lost;
                continue;
            }
            std::string op = AttributeLocal(message, "PropertyOperation").value();
            if (strcasecmp(op.c_str(), "Initialized") == 0) n.op = Notification::Op::kInitialized;
            if (strcasecmp(op.c_str(), "Deleted") == 0) n.op = Notification::Op::kDeleted;
            n.utc = ParseDateTime(Trimmed(AttributeLocal(message, "UtcTime").value()));
            n.source = SimpleItems(ChildLocal(message, "Source"));
            n.data = SimpleItems(ChildLocal(message, "Data"));
            out.push_back(std::move(n));
        }
    }
    if (dropped) *dropped = lost;
    return out;
}

// ---- values ----

std::optional<int64_t> ParseDateTime(const std::string& text) {
    const std::string s = Trimmed(text.c_str());
    const char* p = s.c_str();
    auto number = [&p](int digits, int* out) {
        int v = 0;
        for (int i = 0; i < digits; ++i, ++p) {
            if (*p < '0' || *p > '9') return false;
            v = v * 10 + (*p - '0');
        }
        *out = v;
        return true;
    };
    auto expect = [&p](const char* any) {
        if (!*p || !strchr(any, *p)) return false;
        ++p;
        return true;
    };
    int year, month, day, hour, minute, second;
    if (!number(4, &year) || !expect("-") || !number(2, &month) || !expect("-") ||
        !number(2, &day) || !expect("Tt ") || !number(2, &hour) || !expect(":") ||
        !number(2, &minute) || !expect(":") || !number(2, &second))
        return std::nullopt;
    int64_t micros = 0;
    if (*p == '.') {
        ++p;
        int scale = 100000, digits = 0;
        for (; *p >= '0' && *p <= '9'; ++p, ++digits) {
            micros += (*p - '0') * scale;
            scale /= 10;
        }
        if (digits == 0) return std::nullopt;
    }
    int zone = 0;  // minutes east of UTC
    if (*p == 'Z' || *p == 'z') {
        ++p;
    } else if (*p == '+' || *p == '-') {
        int sign = *p++ == '-' ? -1 : 1, zh, zm;
        if (!number(2, &zh)) return std::nullopt;
        if (*p == ':') ++p;
        if (!number(2, &zm) || zh > 14 || zm > 59) return std::nullopt;
        zone = sign * (zh * 60 + zm);
    }
    if (*p) return std::nullopt;
    if (year < 1970 || month < 1 || month > 12 || day < 1 || day > 31 || hour > 24 || minute > 59 ||
        second > 60)
        return std::nullopt;
    int64_t seconds =
        DaysFromCivil(year, month, day) * 86400 + hour * 3600 + minute * 60 + second - zone * 60;
    return seconds * 1000000 + micros;
}

std::optional<bool> ParseBool(const std::string& text) {
    const std::string s = Trimmed(text.c_str());
    if (s == "1" || strcasecmp(s.c_str(), "true") == 0) return true;
    if (s == "0" || strcasecmp(s.c_str(), "false") == 0) return false;
    return std::nullopt;
}

}  // namespace onvif
