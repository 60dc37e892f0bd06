// ONVIF event messages: pull replies written the ways cameras write them
// (SOAP 1.1 and 1.2, prefixes declared anywhere, default namespaces, both
// motion topics, digital inputs, Initialized/Changed/Deleted, times with and
// without fractions and zones, garbage, oversized parts), subscription
// replies, and the event state the guard reads from a run of messages.
#include <gtest/gtest.h>

#include <cmath>
#include <pugixml.hpp>

#include "hostlib/camera/onvif_events.h"
#include "hostlib/camera/onvif_soap.h"

using namespace onvif;

namespace {

const std::string kSoap12 = "http://www.w3.org/2003/05/soap-envelope";
const std::string kSoap11 = "http://schemas.xmlsoap.org/soap/envelope/";
const std::string kDecls =
    " xmlns:tt=\"http://www.onvif.org/ver10/schema\""
    " xmlns:wsnt=\"http://docs.oasis-open.org/wsn/b-2\""
    " xmlns:tev=\"http://www.onvif.org/ver10/events/wsdl\"";

std::string Wrap(const std::string& soapNs, const std::string& decls, const std::string& body) {
    return "<?xml version=\"1.0\"?><E:Envelope xmlns:E=\"" + soapNs + "\"" + decls +
           "><E:Header/><E:Body>" + body + "</E:Body></E:Envelope>";
}

std::string Pull(const std::string& messages) {
    return "<tev:PullMessagesResponse><tev:CurrentTime>2024-05-06T07:08:09Z</tev:CurrentTime>"
           "<tev:TerminationTime>2024-05-06T07:09:09Z</tev:TerminationTime>" +
           messages + "</tev:PullMessagesResponse>";
}

// One wsnt:NotificationMessage; `topicDecl` goes on the Topic element.
std::string Message(const std::string& topic, const std::string& attrs, const std::string& source,
                    const std::string& data, const std::string& topicDecl = "") {
    auto items = [](const std::string& list) {
        std::string out;
        size_t at = 0;
        while (at < list.size()) {
            size_t end = list.find(',', at);
            if (end == std::string::npos) end = list.size();
            std::string item = list.substr(at, end - at);
            size_t eq = item.find('=');
            out += "<tt:SimpleItem Name=\"" + item.substr(0, eq) + "\" Value=\"" +
                   item.substr(eq + 1) + "\"/>";
            at = end + 1;
        }
        return out;
    };
    return "<wsnt:NotificationMessage><wsnt:Topic" + topicDecl +
           " Dialect=\"http://www.onvif.org/ver10/tev/topicExpression/ConcreteSet\">" + topic +
           "</wsnt:Topic><wsnt:Message><tt:Message " + attrs + "><tt:Source>" + items(source) +
           "</tt:Source><tt:Data>" + items(data) +
           "</tt:Data></tt:Message></wsnt:Message>"
           "</wsnt:NotificationMessage>";
}

const int64_t kT = 1714979289LL * 1000000;  // 2024-05-06T07:08:09Z

// "C tns1|VideoSource/MotionAlarm Source=VS_1 | State=true @+0.25" per message.
std::string Summary(const std::vector<Notification>& messages) {
    std::string out;
    for (const Notification& n : messages) {
        out += n.op == Notification::Op::kChanged       ? "C "
               : n.op == Notification::Op::kInitialized ? "I "
                                                        : "D ";
        out += (n.topicNs == kNsTopics ? "tns1"
                : n.topicNs.empty()    ? "-"
                                       : n.topicNs) +
               "|" + n.topic;
        for (const auto& i : n.source) out += " " + i.first + "=" + i.second;
        out += " |";
        for (const auto& i : n.data) out += " " + i.first + "=" + i.second;
        char at[32] = " @-";
        if (n.utc) snprintf(at, sizeof at, " @%+g", (*n.utc - kT) / 1e6);
        out += std::string(at) + "\n";
    }
    return out;
}

TEST(OnvifEventSoap, PullRepliesFromEveryDialect) {
    const std::string changed =
        "UtcTime=\"2024-05-06T07:08:09.250Z\" PropertyOperation=\"Changed\"";
    const std::string cell =
        "VideoSourceConfigurationToken=VSC_1,VideoAnalyticsConfigurationToken=VAC_1,Rule=Motion";
    struct Case {
        const char* name;
        std::string reply;
        std::string expected;
    } cases[] = {
        {"SOAP 1.2, both motion topics, several messages, header blocks",
         Wrap(
             kSoap12, kDecls + " xmlns:tns1=\"http://www.onvif.org/ver10/topics\"",
             Pull(Message("tns1:RuleEngine/CellMotionDetector/Motion", changed, cell,
                          "IsMotion=true") +
                  Message("tns1:RuleEngine/CellMotionDetector/Motion",
                          "UtcTime=\"2024-05-06T07:08:09.75Z\" PropertyOperation=\"Changed\"", cell,
                          "IsMotion=false") +
                  Message(" tns1:VideoSource/MotionAlarm ", changed, "Source=VS_1", "State=true"))),
         "C tns1|RuleEngine/CellMotionDetector/Motion VideoSourceConfigurationToken=VSC_1 "
         "VideoAnalyticsConfigurationToken=VAC_1 Rule=Motion | IsMotion=true @+0.25\n"
         "C tns1|RuleEngine/CellMotionDetector/Motion VideoSourceConfigurationToken=VSC_1 "
         "VideoAnalyticsConfigurationToken=VAC_1 Rule=Motion | IsMotion=false @+0.75\n"
         "C tns1|VideoSource/MotionAlarm Source=VS_1 | State=true @+0.25\n"},
        {"SOAP 1.1, topic prefix declared on the Topic, Initialized input, times without fraction",
         Wrap(kSoap11, kDecls,
              Pull(Message("ev:Device/Trigger/DigitalInput",
                           "PropertyOperation=\"Initialized\" UtcTime=\"2024-05-06T07:08:10Z\"",
                           "InputToken=DIN_1", "LogicalState=false",
                           " xmlns:ev=\"http://www.onvif.org/ver10/topics\""))),
         "I tns1|Device/Trigger/DigitalInput InputToken=DIN_1 | LogicalState=false @+1\n"},
        {"default namespaces everywhere, zones",
         Wrap(kSoap12, " xmlns:t=\"http://www.onvif.org/ver10/topics\"",
              "<PullMessagesResponse xmlns=\"http://www.onvif.org/ver10/events/wsdl\">"
              "<NotificationMessage xmlns=\"http://docs.oasis-open.org/wsn/b-2\"><Topic>"
              "t:VideoSource/MotionAlarm</Topic><Message><Message xmlns=\"http://www.onvif.org/"
              "ver10/schema\" UtcTime=\"2024-05-06T09:08:09+02:00\"><Source><SimpleItem "
              "Name=\"Source\" Value=\"0\"/></Source><Data><SimpleItem Name=\"State\" "
              "Value=\"TRUE\"/></Data></Message></Message></NotificationMessage>"
              "<NotificationMessage xmlns=\"http://docs.oasis-open.org/wsn/b-2\"><Topic>"
              "t:VideoSource/MotionAlarm</Topic><Message><Message xmlns=\"http://www.onvif.org/"
              "ver10/schema\" UtcTime=\"2024-05-06T07:08:09\" PropertyOperation=\"Deleted\">"
              "<Source><SimpleItem Name=\"Source\" Value=\"0\"/></Source></Message></Message>"
              "</NotificationMessage></PullMessagesResponse>"),
         "C tns1|VideoSource/MotionAlarm Source=0 | State=TRUE @+0\n"
         "D tns1|VideoSource/MotionAlarm Source=0 | @+0\n"},
        {"namespaces compared by URI: tns1 bound elsewhere, undeclared tns1, bare topics",
         Wrap(kSoap12, kDecls + " xmlns:tns1=\"urn:vendor\"",
              Pull(Message("tns1:VideoSource/MotionAlarm", "", "", "State=1") +
                   Message("x:VideoSource/y:Sub/z:Leaf", "", "", "State=0",
                           " xmlns:x=\"http://www.onvif.org/ver10/topics\" xmlns:y=\"http://"
                           "www.onvif.org/ver10/topics\" xmlns:z=\"urn:z\"") +
                   Message("VideoSource/MotionAlarm", "UtcTime=\"garbage\"", "", "State=1"))),
         "C urn:vendor|VideoSource/MotionAlarm | State=1 @-\n"
         "C tns1|VideoSource/Sub/{urn:z}Leaf | State=0 @-\n"
         "C -|VideoSource/MotionAlarm | State=1 @-\n"},
        {"tns1 declared nowhere is the ONVIF topic namespace",
         Wrap(kSoap12, kDecls,
              Pull(Message("tns1:Device/Trigger/DigitalInput", "", "", "LogicalState=1"))),
         "C tns1|Device/Trigger/DigitalInput | LogicalState=1 @-\n"},
    };
    for (const Case& c : cases) {
        Reply r;
        ASSERT_TRUE(r.Parse(c.reply)) << c.name;
        size_t dropped = 1;
        EXPECT_EQ(Summary(r.Notifications(&dropped)), c.expected) << c.name;
        EXPECT_EQ(dropped, 0u) << c.name;
    }
    Reply r;
    ASSERT_TRUE(r.Parse(Wrap(kSoap12, kDecls, Pull(""))));
    EXPECT_TRUE(r.Notifications().empty());
    EXPECT_EQ(*r.Termination().termination - *r.Termination().current, 60000000);
}

TEST(OnvifEventSoap, GarbageFaultsAndOversizedRepliesStayBounded) {
    Reply r;
    for (const std::string& bad : {std::string("<<<"), std::string("<html/>"), std::string()})
        EXPECT_FALSE(r.Parse(bad));
    ASSERT_TRUE(r.Parse(Wrap(kSoap11, "",
                             "<E:Fault><faultcode>E:Client</faultcode><faultstring>gone"
                             "</faultstring></E:Fault>")));
    EXPECT_TRUE(r.IsFault());
    EXPECT_TRUE(r.Notifications().empty());
    // Not a pull reply: no messages read from it.
    ASSERT_TRUE(r.Parse(Wrap(kSoap12, kDecls,
                             "<tev:RenewResponse>" +
                                 Message("tns1:VideoSource/MotionAlarm", "", "", "State=1") +
                                 "</tev:RenewResponse>")));
    EXPECT_TRUE(r.Notifications().empty());

    std::string messages;
    for (int i = 0; i < 70; ++i) messages += Message("tns1:A", "", "", "State=1");
    messages += Message("tns1:" + std::string(300, 'x'), "", "", "State=1");  // topic too long
    messages +=
        "<wsnt:NotificationMessage><wsnt:Topic>tns1:A</wsnt:Topic></wsnt:NotificationMessage>";
    messages +=
        "<wsnt:NotificationMessage><wsnt:Topic>tns1:A//B</wsnt:Topic><wsnt:Message><tt:Message/></"
        "wsnt:Message></wsnt:NotificationMessage>";
    ASSERT_TRUE(r.Parse(Wrap(kSoap12, kDecls, Pull(messages))));
    size_t dropped = 0;
    EXPECT_EQ(r.Notifications(&dropped).size(), kMaxNotifications);
    EXPECT_EQ(dropped, 70 - kMaxNotifications + 3);

    std::string many;
    for (int i = 0; i < 20; ++i)
        many += (i ? "," : "") + std::string("N") + std::to_string(i) + "=v";
    ASSERT_TRUE(r.Parse(Wrap(
        kSoap12, kDecls,
        Pull(Message("tns1:A", "", many, std::string(200, 'n') + "=" + std::string(300, 'v'))))));
    auto n = r.Notifications();
    ASSERT_EQ(n.size(), 1u);
    EXPECT_EQ(n[0].source.size(), kMaxItems);
    EXPECT_EQ(n[0].data[0].first.size(), kMaxItemChars);
    EXPECT_EQ(n[0].data[0].second.size(), kMaxItemChars);
}

TEST(OnvifEventSoap, SubscriptionReplyAndRequests) {
    Reply r;
    ASSERT_TRUE(r.Parse(Wrap(
        kSoap12, kDecls + " xmlns:a=\"http://www.w3.org/2005/08/addressing\" xmlns:v=\"urn:v\"",
        "<tev:CreatePullPointSubscriptionResponse><tev:SubscriptionReference><a:Address> "
        "http://10.0.0.9:8080/onvif/sub?id=3 </a:Address><a:ReferenceParameters><v:Id "
        "a:IsReferenceParameter=\"1\">3</v:Id><Plain>x</Plain></a:ReferenceParameters>"
        "</tev:SubscriptionReference><wsnt:CurrentTime>2024-05-06T07:08:09Z</wsnt:CurrentTime>"
        "<wsnt:TerminationTime>2024-05-06T07:08:19Z</wsnt:TerminationTime>"
        "</tev:CreatePullPointSubscriptionResponse>")));
    Reply::Subscription s = r.PullPointSubscription();
    EXPECT_EQ(s.address, "http://10.0.0.9:8080/onvif/sub?id=3");
    EXPECT_EQ(*s.termination - *s.current, 10000000);
    // The reference parameters stand on their own in our request header.
    pugi::xml_document header;
    ASSERT_TRUE(header.load_string(
        ("<h>" + SubscriptionHeader(EventCall::kPullMessages, s.address, s.referenceParameters) +
         "</h>")
            .c_str()));
    pugi::xml_node id = header.child("h").child("v:Id");
    EXPECT_STREQ(id.attribute("xmlns:v").value(), "urn:v");
    EXPECT_STREQ(id.attribute("xmlns:a").value(), "http://www.w3.org/2005/08/addressing");
    EXPECT_FALSE(header.child("h").child("Plain").attribute("xmlns"));
    EXPECT_STREQ(header.child("h").child("wsa:To").text().as_string(), s.address.c_str());
    EXPECT_EQ(std::string(header.child("h").child("wsa:Action").text().as_string()),
              EventAction(EventCall::kPullMessages));

    pugi::xml_document body;
    ASSERT_TRUE(body.load_string(EventBody(EventCall::kPullMessages, 0, 32).c_str()));
    EXPECT_STREQ(body.first_child().child("tev:Timeout").text().as_string(), "PT1S");
    EXPECT_EQ(body.first_child().child("tev:MessageLimit").text().as_int(), 32);
}

TEST(OnvifEventSoap, DateTimesAndBooleans) {
    struct {
        const char* text;
        int64_t us;  // from kT; INT64_MIN: unreadable
    } times[] = {
        {"2024-05-06T07:08:09Z", 0},
        {" 2024-05-06t07:08:09.5z ", 500000},
        {"2024-05-06T07:08:09.1234567Z", 123456},
        {"2024-05-06T07:08:09", 0},
        {"2024-05-06T09:38:09+02:30", 0},
        {"2024-05-06T02:08:09-0500", 0},
        {"2024-03-01T00:00:00Z", -5728089LL * 1000000},  // across a leap day
        {"", INT64_MIN},
        {"2024-05-06", INT64_MIN},
        {"2024-13-06T07:08:09Z", INT64_MIN},
        {"2024-05-06T07:08:09.Z", INT64_MIN},
        {"2024-05-06T07:08:09Zjunk", INT64_MIN},
        {"1969-12-31T23:59:59Z", INT64_MIN},
        {"24-05-06T07:08:09Z", INT64_MIN},
    };
    for (const auto& t : times) {
        auto got = ParseDateTime(t.text);
        if (t.us == INT64_MIN) {
            EXPECT_FALSE(got) << t.text;
        } else {
            ASSERT_TRUE(got) << t.text;
            EXPECT_EQ(*got - kT, t.us) << t.text;
        }
    }
    for (const char* yes : {"true", "TRUE", " True ", "1"}) EXPECT_EQ(ParseBool(yes), true) << yes;
    for (const char* no : {"false", "False", "0"}) EXPECT_EQ(ParseBool(no), false) << no;
    for (const char* neither : {"", "yes", "2", "truex", "01"}) EXPECT_FALSE(ParseBool(neither));
}

// ---- the event state ----

struct Step {
    char op;            // C(hanged), I(nitialized), D(eleted), L(ose the subscription), X (clear)
    std::string topic;  // "m" motion alarm, "c" cell motion, "i" digital input, else literal
    std::string value;  // the item's value; with "item=value", that item
    double utc;         // seconds from kT on the camera's clock; NAN: none
    double arrived;     // seconds from kT on ours
    std::string source = "Source=VS_1";
};

Notification Make(const Step& s) {
    Notification n;
    n.op = s.op == 'I'   ? Notification::Op::kInitialized
           : s.op == 'D' ? Notification::Op::kDeleted
                         : Notification::Op::kChanged;
    std::string item = "State";
    n.topicNs = kNsTopics;
    n.topic = s.topic;
    if (s.topic == "m") n.topic = "VideoSource/MotionAlarm";
    if (s.topic == "c") n.topic = "RuleEngine/CellMotionDetector/Motion", item = "IsMotion";
    if (s.topic == "i") n.topic = "Device/Trigger/DigitalInput", item = "LogicalState";
    if (s.topic.rfind("{", 0) == 0) {
        n.topicNs = s.topic.substr(1, s.topic.find('}') - 1);
        n.topic = s.topic.substr(s.topic.find('}') + 1);
    }
    std::string value = s.value;
    if (value.find('=') != std::string::npos) {
        item = value.substr(0, value.find('='));
        value = value.substr(value.find('=') + 1);
    }
    if (n.op != Notification::Op::kDeleted) n.data.push_back({item, value});
    if (!s.source.empty())
        n.source.push_back(
            {s.source.substr(0, s.source.find('=')), s.source.substr(s.source.find('=') + 1)});
    if (!std::isnan(s.utc)) n.utc = kT + static_cast<int64_t>(s.utc * 1e6);
    return n;
}

TEST(EventTracker, WhatTheGuardReads) {
    const double none = NAN;
    struct Case {
        const char* name;
        std::vector<Step> steps;
        std::string expected;  // "active@stamp alarms": stamp "now", seconds from kT, or 0
        int64_t offsetS = 0;   // camera clock minus ours
        std::vector<EventTopic> topics = MotionTopics();
    } cases[] = {
        {"Initialized true: present, no alarm", {{'I', "m", "true", 0, 1}}, "1@now a0"},
        {"Initialized false is no fall", {{'I', "m", "false", 0, 1}}, "0@0 a0"},
        {"a pulse within one pull",
         {{'C', "c", "true", 2, 4}, {'C', "c", "false", 3, 4}},
         "1@3 a1"},
        {"the fall on our clock",
         {{'C', "m", "true", 3602, 4}, {'C', "m", "false", 3603, 4}},
         "1@3 a1",
         3600},
        {"a fall never after its arrival",
         {{'C', "m", "true", 1, 2}, {'C', "m", "false", 9, 4}},
         "1@4 a1"},
        {"a change to false without a time: its arrival, also from unknown",
         {{'C', "m", "false", none, 4}},
         "1@4 a0"},
        {"a true repeated is one alarm",
         {{'C', "m", "true", 1, 1},
          {'C', "m", "1", 2, 2},
          {'C', "m", "FALSE", 3, 3},
          {'C', "m", "maybe", 4, 4}},
         "1@3 a1"},
        {"Deleted: absent", {{'C', "m", "true", 1, 1}, {'D', "m", "", 2, 2}}, "0@0 a1"},
        {"one true source keeps the event true",
         {{'I', "m", "true", 1, 1}, {'I', "m", "false", 1, 1, "Source=VS_2"}},
         "1@now a0"},
        {"the last source to fall sets the time",
         {{'C', "m", "true", 1, 1},
          {'C', "m", "true", 1, 1, "Source=VS_2"},
          {'C', "m", "false", 2, 2},
          {'C', "m", "false", 3, 3, "Source=VS_2"},
          {'I', "m", "false", 4, 4}},
         "1@3 a2"},
        {"lost while true: true until then, an Initialized false after is no fall",
         {{'I', "m", "true", 1, 1}, {'L', "", "", 0, 5}, {'I', "m", "false", 6, 6}},
         "1@5 a0"},
        {"the camera gone: nothing known, alarms kept",
         {{'C', "m", "true", 1, 1}, {'X', "", "", 0, 2}},
         "0@0 a1"},
        {"other topics, items and namespaces are not motion",
         {{'C', "i", "true", 1, 1},
          {'C', "m", "Other=true", 1, 1},
          {'C', "{urn:vendor}VideoSource/MotionAlarm", "true", 1, 1}},
         "0@0 a0"},
        {"a bare topic matches any namespace",
         {{'C', "{}VideoSource/MotionAlarm", "true", 1, 1}},
         "1@now a1"},
        {"a source filter",
         {{'C', "i", "true", 1, 1, "InputToken=DIN_1"},
          {'C', "i", "true", 2, 2, "InputToken=DIN_2"},
          {'C', "i", "false", 3, 3, "InputToken=DIN_2"}},
         "1@3 a1",
         0,
         {{"tns1:Device/Trigger/DigitalInput", "LogicalState", "InputToken=DIN_2"}}},
        {"at most kMaxSources sources",
         {{'I', "m", "false", 1, 1, "S=1"},
          {'I', "m", "false", 1, 1, "S=2"},
          {'I', "m", "false", 1, 1, "S=3"},
          {'I', "m", "false", 1, 1, "S=4"},
          {'I', "m", "false", 1, 1, "S=5"},
          {'I', "m", "false", 1, 1, "S=6"},
          {'I', "m", "false", 1, 1, "S=7"},
          {'I', "m", "false", 1, 1, "S=8"},
          {'C', "m", "true", 2, 2, "S=9"}},
         "0@0 a0"},
    };
    const int64_t now = kT + 10000000;
    for (const Case& c : cases) {
        EventTracker t(c.topics);
        for (const Step& s : c.steps) {
            int64_t arrived = kT + static_cast<int64_t>(s.arrived * 1e6);
            if (s.op == 'L') {
                t.Lose(arrived);
            } else if (s.op == 'X') {
                t.Clear();
            } else {
                t.Apply(Make(s), arrived, c.offsetS * 1000000);
            }
        }
        EVENT_STATUS e = t.Read(now);
        int64_t stamp = int64_t{e.timestamp.tv_sec} * 1000000 + e.timestamp.tv_usec;
        char got[64];
        if (stamp == now) {
            snprintf(got, sizeof got, "%d@now a%lu", e.active, t.Info().alarms);
        } else {
            snprintf(got, sizeof got, "%d@%g a%lu", e.active, stamp ? (stamp - kT) / 1e6 : 0.0,
                     t.Info().alarms);
        }
        EXPECT_EQ(got, c.expected) << c.name;
        EXPECT_EQ(e.reserved, static_cast<int>(t.Info().alarms)) << c.name;
    }
}

}  // namespace
