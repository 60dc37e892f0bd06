// ONVIF SOAP building and reading: replies written the ways different cameras
// write them, faults, signed requests and preset token positions.
#include "hostlib/camera/onvif_soap.h"

#include <gtest/gtest.h>

#include <pugixml.hpp>

using namespace onvif;

namespace {

// A reply envelope with the given SOAP prefix ("" = default namespace).
std::string Wrap(const std::string& soap, const std::string& inner) {
    std::string p = soap.empty() ? "" : soap + ":";
    std::string ns = soap.empty() ? " xmlns" : " xmlns:" + soap;
    return "<?xml version=\"1.0\"?><" + p + "Envelope" + ns +
           "=\"http://www.w3.org/2003/05/soap-envelope\"><" + p + "Body>" + inner + "</" + p +
           "Body></" + p + "Envelope>";
}

const std::string kPtz = "\"http://www.onvif.org/ver20/ptz/wsdl\"";
const std::string kTt = "\"http://www.onvif.org/ver10/schema\"";

TEST(OnvifSoap, PresetRepliesAreReadByNamespaceWhateverThePrefixes) {
    // Prefixed and default-namespace replies; presets without a token are skipped.
    const std::string prefixed =
        "<tptz:GetPresetsResponse xmlns:tptz=" + kPtz + " xmlns:tt=" + kTt +
        "><tptz:Preset token=\"1\"><tt:Name>Home</tt:Name></tptz:Preset><tptz:Preset><tt:Name>"
        "None</tt:Name></tptz:Preset><tptz:Preset token=\"Preset_7\"><tt:Name> Gate </tt:Name>"
        "</tptz:Preset></tptz:GetPresetsResponse>";
    const std::string plain =
        "<GetPresetsResponse xmlns=" + kPtz + "><Preset token=\"1\"><Name xmlns=" + kTt +
        ">Home</Name></Preset><Preset token=\"\"/><Preset token=\"Preset_7\"><Name xmlns=" + kTt +
        ">Gate</Name></Preset></GetPresetsResponse>";
    for (const char* soap : {"SOAP-ENV", "s", "env", ""}) {
        for (const std::string& inner : {prefixed, plain}) {
            Reply r;
            ASSERT_TRUE(r.Parse(Wrap(soap, inner))) << soap;
            auto p = r.Presets();
            ASSERT_EQ(p.size(), 2u) << soap;
            EXPECT_EQ(p[0].token + p[0].name + p[1].token + p[1].name, "1HomePreset_7Gate");
        }
    }
    Reply r;
    // The usual prefix bound to another namespace is not a PTZ reply.
    ASSERT_TRUE(r.Parse(Wrap("s",
                             "<tptz:GetPresetsResponse xmlns:tptz=\"urn:x\"><tptz:Preset "
                             "token=\"1\"/></tptz:GetPresetsResponse>")));
    EXPECT_TRUE(r.Presets().empty());
    // An empty preset list is a valid reply.
    ASSERT_TRUE(r.Parse(Wrap("env", "<x:GetPresetsResponse xmlns:x=" + kPtz + "/>")));
    EXPECT_TRUE(r.Is(kNsPtz, "GetPresetsResponse"));
    EXPECT_TRUE(r.Presets().empty());
}

TEST(OnvifSoap, FaultsAndGarbage) {
    Reply r;
    ASSERT_TRUE(r.Parse(Wrap("e",
                             "<e:Fault><e:Code><e:Value>e:Sender</e:Value><e:Subcode><e:Value>"
                             "ter:NotAuthorized</e:Value></e:Subcode></e:Code><e:Reason>"
                             "<e:Text>Sender not Authorized</e:Text></e:Reason></e:Fault>")));
    ASSERT_TRUE(r.IsFault());
    EXPECT_EQ(r.GetFault().subcode, "ter:NotAuthorized");
    EXPECT_EQ(r.GetFault().reason, "Sender not Authorized");
    for (const std::string& bad : {std::string("<<<not xml"), std::string("<html>Login</html>"),
                                   std::string(), Wrap("s", "")})
        EXPECT_FALSE(r.Parse(bad)) << bad;
}

// The camera's clock: only a UTC time that is one, whatever ints the fields hold.
TEST(OnvifSoap, SystemDateAndTimeIsReadOnlyWhenItIsATime) {
    struct Case {
        const char *year, *month, *day, *hour;
        std::optional<time_t> expected;
    } cases[] = {
        {"2026", "1", "2", "3", 1767322800},  // 2026-01-02T03:00:00Z
        {"1970", "1", "1", "0", 0},
        {"1969", "12", "31", "23", std::nullopt},
        {"10000", "1", "1", "0", std::nullopt},
        {"2026", "13", "1", "0", std::nullopt},
        {"2026", "1", "1", "24", std::nullopt},
        {"-2147483648", "1", "1", "0", std::nullopt},  // no arithmetic on unchecked ints
        {"2026", "-2147483648", "1", "0", std::nullopt},
    };
    for (const Case& c : cases) {
        std::string date = std::string("<tt:Date><tt:Year>") + c.year + "</tt:Year><tt:Month>" +
                           c.month + "</tt:Month><tt:Day>" + c.day + "</tt:Day></tt:Date>";
        std::string time = std::string("<tt:Time><tt:Hour>") + c.hour +
                           "</tt:Hour><tt:Minute>0</tt:Minute><tt:Second>0</tt:Second></tt:Time>";
        Reply r;
        ASSERT_TRUE(r.Parse(Wrap("s",
                                 "<tds:GetSystemDateAndTimeResponse xmlns:tds=\"http://www.onvif.org/"
                                 "ver10/device/wsdl\" xmlns:tt=" +
                                     kTt + "><tds:SystemDateAndTime><tt:UTCDateTime>" + time + date +
                                     "</tt:UTCDateTime></tds:SystemDateAndTime>"
                                     "</tds:GetSystemDateAndTimeResponse>")));
        EXPECT_EQ(r.SystemDateAndTimeUtc(), c.expected) << date << time;
    }
}

TEST(OnvifSoap, MediaServiceIsTheVer10OneNotMedia2) {
    std::string reply = "<GetServicesResponse xmlns=\"http://www.onvif.org/ver10/device/wsdl\">";
    for (std::string s : {"ver20/media Media2", "ver10/media Media", "ver20/ptz PTZ"})
        reply += "<Service><Namespace>http://www.onvif.org/" + s.substr(0, s.find(' ')) +
                 "/wsdl</Namespace><XAddr> http://h/" + s.substr(s.find(' ') + 1) +
                 " </XAddr></Service>";
    Reply r;
    ASSERT_TRUE(r.Parse(Wrap("s", reply + "</GetServicesResponse>")));
    EXPECT_EQ(r.Services().media + " " + r.Services().ptz, "http://h/Media http://h/PTZ");
}

TEST(OnvifSoap, SignedEnvelope) {
    UsernameToken t{"ad<min&", "secret", "0123456789abcdef", "2026-01-02T03:04:05Z"};
    // Base64(SHA1(nonce + created + password)), computed independently.
    const char* digest = "wjpInr7UL0thZOXWecrqoApQnDY=";
    EXPECT_EQ(PasswordDigest(t.nonce, t.created, t.password), digest);
    pugi::xml_document doc;
    ASSERT_TRUE(doc.load_string(Envelope(GotoPresetBody("Profile_1", "P<1>"), &t).c_str()));
    pugi::xml_node token = doc.select_node("//*[local-name()='UsernameToken']").node();
    EXPECT_STREQ(token.child("wsse:Username").text().as_string(), "ad<min&");
    EXPECT_STREQ(token.child("wsse:Password").text().as_string(), digest);
    pugi::xml_node go = doc.select_node("//*[local-name()='GotoPreset']").node();
    EXPECT_STREQ(go.child("tptz:PresetToken").text().as_string(), "P<1>");
}

TEST(OnvifSoap, PresetPositionsAreStableAndDoNotCollide) {
    EXPECT_EQ(PresetPosition("1"), 1);
    // Not canonical decimal: hashed into the negative range, the same in every
    // process (values pinned: they are stored in the database).
    EXPECT_EQ(PresetPosition("Preset_1"), -903916967);
    EXPECT_EQ(PresetPosition("01"), -552431803);
    for (const char* t : {"2147483648", "-3", "+3", " 3", "3a", "", "99999999999"})
        EXPECT_LT(PresetPosition(t), 0) << t;
    EXPECT_EQ(PresetToken(17) + PresetToken(-552431803), "17");  // text positions need the list
    // "p2308" and "p571002" share a hash: the later one moves one down.
    auto m = MapPresets({{"1", "a"}, {"01", "b"}, {"p2308", "c"}, {"p571002", "d"}, {"1", "dup"}});
    EXPECT_EQ(m,
              (std::map<int, std::string>{
                  {1, "1"}, {-552431803, "01"}, {-820614613, "p2308"}, {-820614614, "p571002"}}));
}

}  // namespace
