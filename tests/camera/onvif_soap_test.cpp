// ONVIF SOAP building and reading: requests as cameras must see them, and
// replies written the ways different cameras write them.
#include "hostlib/onvif_soap.h"

#include <gtest/gtest.h>
#include <limits.h>

#include <pugixml.hpp>

using namespace onvif;

namespace {

// A reply envelope with the given prefix for SOAP and for the ONVIF elements
// ("" = default namespace).
std::string Wrap(const std::string& soap, const std::string& inner) {
    std::string e = soap.empty() ? "Envelope" : soap + ":Envelope";
    std::string b = soap.empty() ? "Body" : soap + ":Body";
    std::string decl = soap.empty()
                           ? " xmlns=\"http://www.w3.org/2003/05/soap-envelope\""
                           : " xmlns:" + soap + "=\"http://www.w3.org/2003/05/soap-envelope\"";
    return "<?xml version=\"1.0\"?><" + e + decl + "><" + b + ">" + inner + "</" + b + "></" + e +
           ">";
}

const char* kPresetsTt =
    "<tptz:GetPresetsResponse xmlns:tptz=\"http://www.onvif.org/ver20/ptz/wsdl\" "
    "xmlns:tt=\"http://www.onvif.org/ver10/schema\">"
    "<tptz:Preset token=\"1\"><tt:Name>Home</tt:Name></tptz:Preset>"
    "<tptz:Preset><tt:Name>No token</tt:Name></tptz:Preset>"
    "<tptz:Preset token=\"Preset_7\"><tt:Name> Gate </tt:Name></tptz:Preset>"
    "</tptz:GetPresetsResponse>";

// The same reply with default namespaces only.
const char* kPresetsDefault =
    "<GetPresetsResponse xmlns=\"http://www.onvif.org/ver20/ptz/wsdl\">"
    "<Preset token=\"1\"><Name xmlns=\"http://www.onvif.org/ver10/schema\">Home</Name></Preset>"
    "<Preset token=\"\"><Name xmlns=\"http://www.onvif.org/ver10/schema\">Empty</Name></Preset>"
    "<Preset token=\"Preset_7\"><Name xmlns=\"http://www.onvif.org/ver10/schema\">Gate</Name>"
    "</Preset></GetPresetsResponse>";

TEST(OnvifSoap, PresetRepliesReadAlikeWhateverThePrefixes) {
    for (const char* soap : {"SOAP-ENV", "s", "env", ""}) {
        for (const char* inner : {kPresetsTt, kPresetsDefault}) {
            Reply r;
            ASSERT_TRUE(r.Parse(Wrap(soap, inner))) << soap;
            EXPECT_FALSE(r.IsFault());
            auto presets = r.Presets();
            ASSERT_EQ(presets.size(), 2u) << soap;  // the preset without a token is skipped
            EXPECT_EQ(presets[0].token, "1");
            EXPECT_EQ(presets[0].name, "Home");
            EXPECT_EQ(presets[1].token, "Preset_7");
            EXPECT_EQ(presets[1].name, "Gate");
        }
    }
}

TEST(OnvifSoap, ElementsAreMatchedByNamespaceNotByPrefix) {
    Reply r;
    // The tptz prefix bound to the wrong namespace: not a PTZ reply.
    ASSERT_TRUE(r.Parse(Wrap("s",
                             "<tptz:GetPresetsResponse xmlns:tptz=\"urn:other\">"
                             "<tptz:Preset token=\"1\"/></tptz:GetPresetsResponse>")));
    EXPECT_TRUE(r.Presets().empty());
    // An unusual prefix bound to the right namespace is fine.
    ASSERT_TRUE(r.Parse(Wrap("s",
                             "<x:GetPresetsResponse xmlns:x=\"http://www.onvif.org/ver20/"
                             "ptz/wsdl\"><x:Preset token=\"3\"/></x:GetPresetsResponse>")));
    ASSERT_EQ(r.Presets().size(), 1u);
    EXPECT_EQ(r.Presets()[0].token, "3");
    // An empty preset list.
    ASSERT_TRUE(r.Parse(Wrap("env",
                             "<tptz:GetPresetsResponse xmlns:tptz=\"http://www.onvif.org/"
                             "ver20/ptz/wsdl\"/>")));
    EXPECT_TRUE(r.Is(kNsPtz, "GetPresetsResponse"));
    EXPECT_TRUE(r.Presets().empty());
}

TEST(OnvifSoap, FaultsAndGarbage) {
    Reply r;
    ASSERT_TRUE(r.Parse(Wrap(
        "SOAP-ENV",
        "<SOAP-ENV:Fault xmlns:ter=\"http://www.onvif.org/ver10/error\"><SOAP-ENV:Code>"
        "<SOAP-ENV:Value>SOAP-ENV:Sender</SOAP-ENV:Value><SOAP-ENV:Subcode><SOAP-ENV:Value>"
        "ter:NotAuthorized</SOAP-ENV:Value></SOAP-ENV:Subcode></SOAP-ENV:Code><SOAP-ENV:Reason>"
        "<SOAP-ENV:Text xml:lang=\"en\">Sender not Authorized</SOAP-ENV:Text></SOAP-ENV:Reason>"
        "</SOAP-ENV:Fault>")));
    ASSERT_TRUE(r.IsFault());
    EXPECT_EQ(r.GetFault().subcode, "ter:NotAuthorized");
    EXPECT_EQ(r.GetFault().reason, "Sender not Authorized");
    EXPECT_TRUE(r.Presets().empty());
    EXPECT_FALSE(r.Is(kNsSoap, "Fault"));  // a fault is never a response

    // SOAP 1.1 faults from older firmware.
    ASSERT_TRUE(
        r.Parse("<soap:Envelope xmlns:soap=\"http://schemas.xmlsoap.org/soap/envelope/\">"
                "<soap:Body><soap:Fault><faultcode>soap:Client</faultcode><faultstring>"
                "bad</faultstring></soap:Fault></soap:Body></soap:Envelope>"));
    ASSERT_TRUE(r.IsFault());
    EXPECT_EQ(r.GetFault().reason, "bad");

    EXPECT_FALSE(r.Parse("<<<not xml"));
    EXPECT_FALSE(r.Parse("<html><body>Login</body></html>"));
    EXPECT_FALSE(r.Parse(Wrap("s", "")));  // empty body
    EXPECT_FALSE(r.Parse(""));
}

TEST(OnvifSoap, SystemDateAndTime) {
    const std::string utc =
        "<tds:GetSystemDateAndTimeResponse xmlns:tds=\"http://www.onvif.org/ver10/device/wsdl\" "
        "xmlns:tt=\"http://www.onvif.org/ver10/schema\"><tds:SystemDateAndTime>"
        "<tt:DateTimeType>NTP</tt:DateTimeType><tt:UTCDateTime><tt:Time><tt:Hour>3</tt:Hour>"
        "<tt:Minute>4</tt:Minute><tt:Second>5</tt:Second></tt:Time><tt:Date><tt:Year>2026"
        "</tt:Year><tt:Month>1</tt:Month><tt:Day>2</tt:Day></tt:Date></tt:UTCDateTime>"
        "</tds:SystemDateAndTime></tds:GetSystemDateAndTimeResponse>";
    Reply r;
    ASSERT_TRUE(r.Parse(Wrap("env", utc)));
    ASSERT_TRUE(r.SystemDateAndTimeUtc().has_value());
    EXPECT_EQ(FormatUtc(*r.SystemDateAndTimeUtc()), "2026-01-02T03:04:05Z");

    std::string local = utc;
    size_t at;
    while ((at = local.find("UTCDateTime")) != std::string::npos) local.replace(at, 3, "Local");
    ASSERT_TRUE(r.Parse(Wrap("env", local)));
    EXPECT_FALSE(r.SystemDateAndTimeUtc().has_value());

    std::string broken = utc;
    broken.replace(broken.find(">3<"), 3, ">99<");
    ASSERT_TRUE(r.Parse(Wrap("env", broken)));
    EXPECT_FALSE(r.SystemDateAndTimeUtc().has_value());
}

TEST(OnvifSoap, ServiceAddressesFromServicesOrCapabilities) {
    Reply r;
    ASSERT_TRUE(
        r.Parse(Wrap("s",
                     "<GetServicesResponse xmlns=\"http://www.onvif.org/ver10/device/wsdl\">"
                     "<Service><Namespace>http://www.onvif.org/ver10/device/wsdl</Namespace><XAddr>"
                     "http://10.0.0.5/onvif/device_service</XAddr></Service>"
                     "<Service><Namespace>http://www.onvif.org/ver20/media/wsdl</Namespace><XAddr>"
                     "http://10.0.0.5/onvif/Media2</XAddr></Service>"
                     "<Service><Namespace>http://www.onvif.org/ver10/media/wsdl</Namespace><XAddr>"
                     " http://10.0.0.5/onvif/Media </XAddr></Service>"
                     "<Service><Namespace>http://www.onvif.org/ver20/ptz/wsdl</Namespace><XAddr>"
                     "http://10.0.0.5/onvif/PTZ</XAddr></Service></GetServicesResponse>")));
    EXPECT_EQ(r.Services().media, "http://10.0.0.5/onvif/Media");
    EXPECT_EQ(r.Services().ptz, "http://10.0.0.5/onvif/PTZ");
    EXPECT_TRUE(r.Capabilities().media.empty());

    ASSERT_TRUE(r.Parse(
        Wrap("SOAP-ENV",
             "<tds:GetCapabilitiesResponse xmlns:tds=\"http://www.onvif.org/ver10/device/wsdl\" "
             "xmlns:tt=\"http://www.onvif.org/ver10/schema\"><tds:Capabilities><tt:Media><tt:XAddr>"
             "http://192.168.1.64:8080/media</tt:XAddr></tt:Media></tds:Capabilities>"
             "</tds:GetCapabilitiesResponse>")));
    EXPECT_EQ(r.Capabilities().media, "http://192.168.1.64:8080/media");
    EXPECT_EQ(r.Capabilities().ptz, "");
}

TEST(OnvifSoap, Profiles) {
    Reply r;
    ASSERT_TRUE(r.Parse(Wrap(
        "env",
        "<trt:GetProfilesResponse xmlns:trt=\"http://www.onvif.org/ver10/media/wsdl\" "
        "xmlns:tt=\"http://www.onvif.org/ver10/schema\">"
        "<trt:Profiles token=\"main\"><tt:VideoSourceConfiguration token=\"v\"><tt:SourceToken>"
        "VS1</tt:SourceToken></tt:VideoSourceConfiguration><tt:VideoEncoderConfiguration>"
        "<tt:Resolution><tt:Width>1920</tt:Width><tt:Height>1080</tt:Height></tt:Resolution>"
        "</tt:VideoEncoderConfiguration><tt:PTZConfiguration token=\"p\"/></trt:Profiles>"
        "<trt:Profiles><tt:Name>no token</tt:Name></trt:Profiles>"
        "<trt:Profiles token=\"sub\"><tt:VideoSourceConfiguration><tt:SourceToken>VS1"
        "</tt:SourceToken></tt:VideoSourceConfiguration></trt:Profiles>"
        "</trt:GetProfilesResponse>")));
    auto p = r.Profiles();
    ASSERT_EQ(p.size(), 2u);
    EXPECT_EQ(p[0].token, "main");
    EXPECT_EQ(p[0].sourceToken, "VS1");
    EXPECT_EQ(p[0].width, 1920);
    EXPECT_EQ(p[0].height, 1080);
    EXPECT_TRUE(p[0].ptz);
    EXPECT_EQ(p[1].token, "sub");
    EXPECT_EQ(p[1].width, 0);
    EXPECT_FALSE(p[1].ptz);
}

TEST(OnvifSoap, SignedEnvelope) {
    UsernameToken t;
    t.user = "ad<min&";
    t.password = "secret";
    t.nonce = "0123456789abcdef";
    t.created = "2026-01-02T03:04:05Z";
    // Base64(SHA1(nonce + created + password)), computed independently.
    EXPECT_EQ(PasswordDigest(t.nonce, t.created, t.password), "wjpInr7UL0thZOXWecrqoApQnDY=");

    std::string text = Envelope(GotoPresetBody("Profile_1", "P<1>"), &t);
    pugi::xml_document doc;
    ASSERT_TRUE(doc.load_string(text.c_str()));
    pugi::xml_node token = doc.select_node("//*[local-name()='UsernameToken']").node();
    ASSERT_TRUE(token);
    EXPECT_STREQ(token.child("wsse:Username").text().as_string(), "ad<min&");
    EXPECT_STREQ(token.child("wsse:Password").text().as_string(), "wjpInr7UL0thZOXWecrqoApQnDY=");
    EXPECT_NE(std::string(token.child("wsse:Password").attribute("Type").as_string())
                  .find("#PasswordDigest"),
              std::string::npos);
    EXPECT_STREQ(token.child("wsse:Nonce").text().as_string(), "MDEyMzQ1Njc4OWFiY2RlZg==");
    EXPECT_STREQ(token.child("wsu:Created").text().as_string(), "2026-01-02T03:04:05Z");
    pugi::xml_node go = doc.select_node("//*[local-name()='GotoPreset']").node();
    EXPECT_STREQ(go.child("tptz:PresetToken").text().as_string(), "P<1>");
    EXPECT_STREQ(go.attribute("xmlns:tptz").as_string(), "http://www.onvif.org/ver20/ptz/wsdl");
    EXPECT_EQ(ActionOf(GotoPresetBody("a", "b")), "http://www.onvif.org/ver20/ptz/wsdl/GotoPreset");
    EXPECT_EQ(ActionOf(GetProfilesBody()), "http://www.onvif.org/ver10/media/wsdl/GetProfiles");

    std::string open = Envelope(GetSystemDateAndTimeBody(), nullptr);
    EXPECT_EQ(open.find("Header"), std::string::npos);
    ASSERT_TRUE(doc.load_string(open.c_str()));
}

TEST(OnvifSoap, PresetPositions) {
    EXPECT_EQ(PresetPosition("1"), 1);
    EXPECT_EQ(PresetPosition("0"), 0);
    EXPECT_EQ(PresetPosition("2147483647"), INT_MAX);
    // Not canonical decimal: hashed into the negative range, the same in every
    // process (values pinned: they are stored in the database).
    EXPECT_EQ(PresetPosition("Preset_1"), -903916967);
    EXPECT_EQ(PresetPosition("P001"), -493092515);
    EXPECT_EQ(PresetPosition("01"), -552431803);
    for (const char* t : {"2147483648", "-3", "+3", " 3", "3a", "", "99999999999"})
        EXPECT_LT(PresetPosition(t), 0) << t;
    EXPECT_EQ(PresetToken(17), "17");
    EXPECT_EQ(PresetToken(-552431803), "");

    // "p2308" and "p571002" share a hash: the later one moves one down.
    auto m = MapPresets({{"1", "a"}, {"01", "b"}, {"p2308", "c"}, {"p571002", "d"}, {"1", "dup"}});
    ASSERT_EQ(m.size(), 4u);
    EXPECT_EQ(m[1], "1");
    EXPECT_EQ(m[-552431803], "01");
    EXPECT_EQ(m[-820614613], "p2308");
    EXPECT_EQ(m[-820614614], "p571002");
}

TEST(OnvifSoap, Urls) {
    auto u = ParseUrl("http://192.168.1.64:8080/onvif/snapshot?channel=1&x=2");
    ASSERT_TRUE(u);
    EXPECT_EQ(u->host, "192.168.1.64");
    EXPECT_EQ(u->port, 8080);
    EXPECT_EQ(u->path, "/onvif/snapshot?channel=1&x=2");
    u = ParseUrl("HTTP://user:pw@cam.local");
    ASSERT_TRUE(u);
    EXPECT_EQ(u->scheme, "http");
    EXPECT_EQ(u->host, "cam.local");
    EXPECT_EQ(u->port, 80);
    EXPECT_EQ(u->path, "/");
    u = ParseUrl("http://[fe80::1]:81?a=b");
    ASSERT_TRUE(u);
    EXPECT_EQ(u->host, "fe80::1");
    EXPECT_EQ(u->port, 81);
    EXPECT_EQ(u->path, "/?a=b");
    EXPECT_FALSE(ParseUrl("/onvif/Media"));
    EXPECT_FALSE(ParseUrl("http://:80/x"));
    EXPECT_FALSE(ParseUrl("http://h:99999/x"));
    EXPECT_FALSE(ParseUrl("http://h:8a/x"));
}

}  // namespace
