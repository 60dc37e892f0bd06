// camsim: the ONVIF device, media and PTZ services (SOAP 1.2).
#include <stdio.h>
#include <string.h>
#include <time.h>

#include <cstdlib>
#include <pugixml.hpp>
#include <sstream>

#include "camsim.h"
#include "camsim_events.h"

namespace camsim {
namespace {

const char* kEnvelopeOpen =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<env:Envelope xmlns:env=\"http://www.w3.org/2003/05/soap-envelope\""
    " xmlns:tt=\"http://www.onvif.org/ver10/schema\""
    " xmlns:tds=\"http://www.onvif.org/ver10/device/wsdl\""
    " xmlns:trt=\"http://www.onvif.org/ver10/media/wsdl\""
    " xmlns:tptz=\"http://www.onvif.org/ver20/ptz/wsdl\""
    " xmlns:ter=\"http://www.onvif.org/ver10/error\">"
    "<env:Body>";
const char* kEnvelopeClose = "</env:Body></env:Envelope>\n";

struct VideoSource {
    const char* token;
    int width, height;
};
struct Profile {
    const char* token;
    const char* name;
    int source;  // index into kSources
    const char* encoder;
    int width, height;
    bool ptz;
};

const VideoSource kSources[] = {{"VS_1", 1920, 1080}, {"VS_2", 1280, 720}};
// The PTZ unit sits on the main profiles; the sub stream of channel 1 has none.
const Profile kProfiles[] = {
    {"Profile_1_main", "mainStream", 0, "VEC_1_main", 1920, 1080, true},
    {"Profile_1_sub", "subStream", 0, "VEC_1_sub", 640, 360, false},
    {"Profile_2_main", "secondStream", 1, "VEC_2_main", 1280, 720, true},
};

std::string Escape(const std::string& s) {
    std::string out;
    for (char c : s) {
        switch (c) {
            case '&':
                out += "&amp;";
                break;
            case '<':
                out += "&lt;";
                break;
            case '>':
                out += "&gt;";
                break;
            case '"':
                out += "&quot;";
                break;
            case '\'':
                out += "&apos;";
                break;
            default:
                out += c;
        }
    }
    return out;
}

const char* LocalName(const char* name) {
    const char* colon = strchr(name, ':');
    return colon ? colon + 1 : name;
}

pugi::xml_node Child(pugi::xml_node node, const char* local) {
    for (pugi::xml_node c = node.first_child(); c; c = c.next_sibling())
        if (c.type() == pugi::node_element && strcmp(LocalName(c.name()), local) == 0) return c;
    return {};
}

std::string ChildText(pugi::xml_node node, const char* local) {
    return Child(node, local).text().as_string();
}

SoapReply Envelope(const std::string& inner) {
    SoapReply r;
    r.body = std::string(kEnvelopeOpen) + inner + kEnvelopeClose;
    return r;
}

SoapReply Fault(State& state, int status, const char* code, const char* subcode,
                const char* reason) {
    SoapReply r = Envelope(std::string("<env:Fault><env:Code><env:Value>") + code +
                           "</env:Value><env:Subcode><env:Value>" + subcode +
                           "</env:Value></env:Subcode></env:Code><env:Reason><env:Text "
                           "xml:lang=\"en\">" +
                           reason + "</env:Text></env:Reason></env:Fault>");
    std::string forced = state.Fault("fault_http_status");
    r.status = forced.empty() ? status : atoi(forced.c_str());
    return r;
}

std::string MediaPath(State& state) {
    return state.Fault("alt_paths") == "1" ? "/onvif/Media" : "/onvif/media_service";
}
std::string PtzPath(State& state) {
    return state.Fault("alt_paths") == "1" ? "/onvif/PTZ" : "/onvif/ptz_service";
}

bool ParseCreated(const std::string& text, time_t* out) {
    struct tm tm = {};
    int y, mo, d, h, mi;
    double s;
    if (sscanf(text.c_str(), "%d-%d-%dT%d:%d:%lf", &y, &mo, &d, &h, &mi, &s) != 6) return false;
    tm.tm_year = y - 1900;
    tm.tm_mon = mo - 1;
    tm.tm_mday = d;
    tm.tm_hour = h;
    tm.tm_min = mi;
    tm.tm_sec = static_cast<int>(s);
    *out = timegm(&tm);
    return true;
}

time_t CameraTime(State& state) {
    return time(nullptr) + atol(state.Fault("clock_skew_s").c_str());
}

// WS-Security UsernameToken check. 1: valid, 0: absent, -1: present but wrong.
int CheckUsernameToken(State& state, pugi::xml_node header) {
    pugi::xml_node token = Child(Child(header, "Security"), "UsernameToken");
    if (!token) return 0;
    std::string user, password;
    {
        std::lock_guard<std::mutex> lock(state.mu);
        user = state.user;
        password = state.password;
    }
    pugi::xml_node pw = Child(token, "Password");
    if (ChildText(token, "Username") != user) return -1;
    std::string type = pw.attribute("Type").as_string();
    if (type.find("PasswordText") != std::string::npos)
        return pw.text().as_string() == password ? 1 : -1;
    std::string nonce = Base64Decode(ChildText(token, "Nonce"));
    std::string created = ChildText(token, "Created");
    if (Base64Encode(Sha1(nonce + created + password)) != pw.text().as_string()) return -1;
    // A token created more than five minutes away from the camera's clock is stale.
    time_t when;
    if (!ParseCreated(created, &when)) return -1;
    long diff = static_cast<long>(when - CameraTime(state));
    return (diff > 300 || diff < -300) ? -1 : 1;
}

std::string DateTimeXml(const char* tag, const struct tm& tm) {
    char buf[400];
    snprintf(buf, sizeof buf,
             "<tt:%s><tt:Time><tt:Hour>%d</tt:Hour><tt:Minute>%d</tt:Minute><tt:Second>%d"
             "</tt:Second></tt:Time><tt:Date><tt:Year>%d</tt:Year><tt:Month>%d</tt:Month>"
             "<tt:Day>%d</tt:Day></tt:Date></tt:%s>",
             tag, tm.tm_hour, tm.tm_min, tm.tm_sec, tm.tm_year + 1900, tm.tm_mon + 1, tm.tm_mday,
             tag);
    return buf;
}

SoapReply GetSystemDateAndTime(State& state) {
    time_t now = CameraTime(state);
    struct tm utc;
    gmtime_r(&now, &utc);
    std::string inner =
        "<tds:GetSystemDateAndTimeResponse><tds:SystemDateAndTime>"
        "<tt:DateTimeType>Manual</tt:DateTimeType><tt:DaylightSavings>false</tt:DaylightSavings>"
        "<tt:TimeZone><tt:TZ>UTC0</tt:TZ></tt:TimeZone>";
    if (state.Fault("time_no_utc") != "1") inner += DateTimeXml("UTCDateTime", utc);
    inner += DateTimeXml("LocalDateTime", utc);
    inner += "</tds:SystemDateAndTime></tds:GetSystemDateAndTimeResponse>";
    return Envelope(inner);
}

SoapReply GetCapabilities(State& state) {
    if (state.Fault("no_get_capabilities") == "1")
        return Fault(state, 500, "env:Receiver", "ter:ActionNotSupported", "Not supported");
    std::string base = BaseAddress(state);
    return Envelope(
        "<tds:GetCapabilitiesResponse><tds:Capabilities>"
        "<tt:Device><tt:XAddr>" +
        base +
        "/onvif/device_service</tt:XAddr>"
        "<tt:Network><tt:IPFilter>false</tt:IPFilter><tt:ZeroConfiguration>false"
        "</tt:ZeroConfiguration><tt:IPVersion6>false</tt:IPVersion6><tt:DynDNS>false</tt:DynDNS>"
        "</tt:Network><tt:System><tt:DiscoveryResolve>false</tt:DiscoveryResolve>"
        "<tt:DiscoveryBye>false</tt:DiscoveryBye><tt:RemoteDiscovery>false</tt:RemoteDiscovery>"
        "<tt:SystemBackup>false</tt:SystemBackup><tt:SystemLogging>false</tt:SystemLogging>"
        "<tt:FirmwareUpgrade>false</tt:FirmwareUpgrade><tt:SupportedVersions><tt:Major>2"
        "</tt:Major><tt:Minor>40</tt:Minor></tt:SupportedVersions></tt:System>"
        "<tt:Security><tt:TLS1.1>false</tt:TLS1.1><tt:TLS1.2>false</tt:TLS1.2>"
        "<tt:OnboardKeyGeneration>false</tt:OnboardKeyGeneration><tt:AccessPolicyConfig>false"
        "</tt:AccessPolicyConfig><tt:X.509Token>false</tt:X.509Token><tt:SAMLToken>false"
        "</tt:SAMLToken><tt:KerberosToken>false</tt:KerberosToken><tt:RELToken>false"
        "</tt:RELToken></tt:Security></tt:Device>"
        "<tt:Events><tt:XAddr>" +
        base + kEventServicePath +
        "</tt:XAddr><tt:WSSubscriptionPolicySupport>false</tt:WSSubscriptionPolicySupport>"
        "<tt:WSPullPointSupport>true</tt:WSPullPointSupport>"
        "<tt:WSPausableSubscriptionManagerInterfaceSupport>false"
        "</tt:WSPausableSubscriptionManagerInterfaceSupport></tt:Events>"
        "<tt:Media><tt:XAddr>" +
        base + MediaPath(state) +
        "</tt:XAddr>"
        "<tt:StreamingCapabilities><tt:RTPMulticast>false</tt:RTPMulticast><tt:RTP_TCP>true"
        "</tt:RTP_TCP><tt:RTP_RTSP_TCP>true</tt:RTP_RTSP_TCP></tt:StreamingCapabilities>"
        "</tt:Media>"
        "<tt:PTZ><tt:XAddr>" +
        base + PtzPath(state) +
        "</tt:XAddr></tt:PTZ>"
        "</tds:Capabilities></tds:GetCapabilitiesResponse>");
}

std::string ServiceXml(const std::string& ns, const std::string& xaddr, int major, int minor) {
    return "<tds:Service><tds:Namespace>" + ns + "</tds:Namespace><tds:XAddr>" + xaddr +
           "</tds:XAddr><tds:Version><tt:Major>" + std::to_string(major) + "</tt:Major><tt:Minor>" +
           std::to_string(minor) + "</tt:Minor></tds:Version></tds:Service>";
}

SoapReply GetServices(State& state) {
    if (state.Fault("no_get_services") == "1")
        return Fault(state, 500, "env:Receiver", "ter:ActionNotSupported", "Not supported");
    std::string base = BaseAddress(state);
    return Envelope(
        "<tds:GetServicesResponse>" +
        ServiceXml("http://www.onvif.org/ver10/device/wsdl", base + "/onvif/device_service", 2,
                   40) +
        ServiceXml("http://www.onvif.org/ver10/media/wsdl", base + MediaPath(state), 2, 40) +
        ServiceXml("http://www.onvif.org/ver20/ptz/wsdl", base + PtzPath(state), 2, 40) +
        ServiceXml("http://www.onvif.org/ver10/events/wsdl", base + kEventServicePath, 2, 40) +
        "</tds:GetServicesResponse>");
}

SoapReply GetDeviceInformation(State& state) {
    int port;
    {
        std::lock_guard<std::mutex> lock(state.mu);
        port = state.port;
    }
    return Envelope(
        "<tds:GetDeviceInformationResponse><tds:Manufacturer>CamSim</tds:Manufacturer>"
        "<tds:Model>CamSim PTZ</tds:Model><tds:FirmwareVersion>1.0</tds:FirmwareVersion>"
        "<tds:SerialNumber>CS-" +
        std::to_string(port) +
        "</tds:SerialNumber>"
        "<tds:HardwareId>camsim</tds:HardwareId></tds:GetDeviceInformationResponse>");
}

SoapReply GetScopes() {
    return Envelope(
        "<tds:GetScopesResponse><tds:Scopes><tt:ScopeDef>Fixed</tt:ScopeDef><tt:ScopeItem>"
        "onvif://www.onvif.org/type/ptz</tt:ScopeItem></tds:Scopes><tds:Scopes><tt:ScopeDef>"
        "Fixed</tt:ScopeDef><tt:ScopeItem>onvif://www.onvif.org/name/CamSim</tt:ScopeItem>"
        "</tds:Scopes></tds:GetScopesResponse>");
}

std::string PtzConfigurationXml() {
    return "<tt:Name>PTZ</tt:Name><tt:UseCount>2</tt:UseCount><tt:NodeToken>PTZNode_1"
           "</tt:NodeToken>"
           "<tt:DefaultAbsolutePantTiltPositionSpace>http://www.onvif.org/ver10/tptz/"
           "PanTiltSpaces/PositionGenericSpace</tt:DefaultAbsolutePantTiltPositionSpace>"
           "<tt:DefaultAbsoluteZoomPositionSpace>http://www.onvif.org/ver10/tptz/ZoomSpaces/"
           "PositionGenericSpace</tt:DefaultAbsoluteZoomPositionSpace>"
           "<tt:DefaultRelativePanTiltTranslationSpace>http://www.onvif.org/ver10/tptz/"
           "PanTiltSpaces/TranslationGenericSpace</tt:DefaultRelativePanTiltTranslationSpace>"
           "<tt:DefaultRelativeZoomTranslationSpace>http://www.onvif.org/ver10/tptz/ZoomSpaces/"
           "TranslationGenericSpace</tt:DefaultRelativeZoomTranslationSpace>"
           "<tt:DefaultContinuousPanTiltVelocitySpace>http://www.onvif.org/ver10/tptz/"
           "PanTiltSpaces/VelocityGenericSpace</tt:DefaultContinuousPanTiltVelocitySpace>"
           "<tt:DefaultContinuousZoomVelocitySpace>http://www.onvif.org/ver10/tptz/ZoomSpaces/"
           "VelocityGenericSpace</tt:DefaultContinuousZoomVelocitySpace>"
           "<tt:DefaultPTZSpeed><tt:PanTilt x=\"1\" y=\"1\" space=\"http://www.onvif.org/ver10/"
           "tptz/PanTiltSpaces/GenericSpeedSpace\"/><tt:Zoom x=\"1\" space=\"http://www.onvif.org/"
           "ver10/tptz/ZoomSpaces/ZoomGenericSpeedSpace\"/></tt:DefaultPTZSpeed>"
           "<tt:DefaultPTZTimeout>PT5S</tt:DefaultPTZTimeout>"
           "<tt:PanTiltLimits><tt:Range><tt:URI>http://www.onvif.org/ver10/tptz/PanTiltSpaces/"
           "PositionGenericSpace</tt:URI><tt:XRange><tt:Min>-1</tt:Min><tt:Max>1</tt:Max>"
           "</tt:XRange><tt:YRange><tt:Min>-1</tt:Min><tt:Max>1</tt:Max></tt:YRange></tt:Range>"
           "</tt:PanTiltLimits><tt:ZoomLimits><tt:Range><tt:URI>http://www.onvif.org/ver10/tptz/"
           "ZoomSpaces/PositionGenericSpace</tt:URI><tt:XRange><tt:Min>0</tt:Min><tt:Max>1"
           "</tt:Max></tt:XRange></tt:Range></tt:ZoomLimits>";
}

std::string EncoderXml(const Profile& p) {
    return std::string("<tt:Name>") + p.encoder +
           "</tt:Name><tt:UseCount>1</tt:UseCount>"
           "<tt:Encoding>H264</tt:Encoding><tt:Resolution><tt:Width>" +
           std::to_string(p.width) + "</tt:Width><tt:Height>" + std::to_string(p.height) +
           "</tt:Height></tt:Resolution>"
           "<tt:Quality>5</tt:Quality><tt:RateControl><tt:FrameRateLimit>25</tt:FrameRateLimit>"
           "<tt:EncodingInterval>1</tt:EncodingInterval><tt:BitrateLimit>4096</tt:BitrateLimit>"
           "</tt:RateControl><tt:H264><tt:GovLength>50</tt:GovLength><tt:H264Profile>Main"
           "</tt:H264Profile></tt:H264><tt:Multicast><tt:Address><tt:Type>IPv4</tt:Type>"
           "<tt:IPv4Address>0.0.0.0</tt:IPv4Address></tt:Address><tt:Port>0</tt:Port><tt:TTL>1"
           "</tt:TTL><tt:AutoStart>false</tt:AutoStart></tt:Multicast><tt:SessionTimeout>PT60S"
           "</tt:SessionTimeout>";
}

std::string ProfileXml(const char* element, const Profile& p) {
    const VideoSource& vs = kSources[p.source];
    std::string vsc = std::string("VSC_") + std::to_string(p.source + 1);
    std::string out =
        std::string("<") + element + " token=\"" + p.token + "\" fixed=\"true\">" + "<tt:Name>" +
        p.name + "</tt:Name>" + "<tt:VideoSourceConfiguration token=\"" + vsc + "\"><tt:Name>" +
        vsc + "</tt:Name><tt:UseCount>2</tt:UseCount><tt:SourceToken>" + vs.token +
        "</tt:SourceToken><tt:Bounds x=\"0\" y=\"0\" width=\"" + std::to_string(vs.width) +
        "\" height=\"" + std::to_string(vs.height) + "\"/></tt:VideoSourceConfiguration>" +
        "<tt:VideoEncoderConfiguration token=\"" + p.encoder + "\">" + EncoderXml(p) +
        "</tt:VideoEncoderConfiguration>";
    if (p.ptz)
        out += "<tt:PTZConfiguration token=\"PTZC_1\">" + PtzConfigurationXml() +
               "</tt:PTZConfiguration>";
    out += std::string("</") + element + ">";
    return out;
}

const Profile* FindProfile(const std::string& token) {
    for (const Profile& p : kProfiles)
        if (token == p.token) return &p;
    return nullptr;
}

SoapReply GetProfiles() {
    std::string inner = "<trt:GetProfilesResponse>";
    for (const Profile& p : kProfiles) inner += ProfileXml("trt:Profiles", p);
    return Envelope(inner + "</trt:GetProfilesResponse>");
}

SoapReply GetProfile(State& state, pugi::xml_node request) {
    const Profile* p = FindProfile(ChildText(request, "ProfileToken"));
    if (!p) return Fault(state, 400, "env:Sender", "ter:InvalidArgVal", "No such profile");
    return Envelope("<trt:GetProfileResponse>" + ProfileXml("trt:Profile", *p) +
                    "</trt:GetProfileResponse>");
}

SoapReply GetVideoSources() {
    std::string inner = "<trt:GetVideoSourcesResponse>";
    for (const VideoSource& vs : kSources)
        inner += std::string("<trt:VideoSources token=\"") + vs.token +
                 "\"><tt:Framerate>25</tt:Framerate><tt:Resolution><tt:Width>" +
                 std::to_string(vs.width) + "</tt:Width><tt:Height>" + std::to_string(vs.height) +
                 "</tt:Height></tt:Resolution></trt:VideoSources>";
    return Envelope(inner + "</trt:GetVideoSourcesResponse>");
}

std::string MediaUri(const std::string& uri) {
    return "<trt:MediaUri><tt:Uri>" + Escape(uri) +
           "</tt:Uri><tt:InvalidAfterConnect>false</tt:InvalidAfterConnect><tt:InvalidAfterReboot>"
           "false</tt:InvalidAfterReboot><tt:Timeout>PT0S</tt:Timeout></trt:MediaUri>";
}

SoapReply GetSnapshotUri(State& state, pugi::xml_node request) {
    const Profile* p = FindProfile(ChildText(request, "ProfileToken"));
    if (!p) return Fault(state, 400, "env:Sender", "ter:InvalidArgVal", "No such profile");
    // A camera whose snapshot URI is its MJPEG stream (a short one).
    const std::string uri = state.Fault("snapshot_stream") == "1"
                                ? "/mjpeg?profile=" + std::string(p->token) + "&frames=20"
                                : "/snapshot.jpg?profile=" + std::string(p->token);
    return Envelope("<trt:GetSnapshotUriResponse>" + MediaUri(BaseAddress(state) + uri) +
                    "</trt:GetSnapshotUriResponse>");
}

SoapReply GetStreamUri(State& state, pugi::xml_node request) {
    const Profile* p = FindProfile(ChildText(request, "ProfileToken"));
    if (!p) return Fault(state, 400, "env:Sender", "ter:InvalidArgVal", "No such profile");
    return Envelope("<trt:GetStreamUriResponse>" +
                    MediaUri("rtsp://127.0.0.1:554/" + std::string(p->token)) +
                    "</trt:GetStreamUriResponse>");
}

// The PTZ requests name a profile; it must be one with the PTZ unit.
const Profile* PtzProfile(pugi::xml_node request) {
    const Profile* p = FindProfile(ChildText(request, "ProfileToken"));
    return p && p->ptz ? p : nullptr;
}

SoapReply NoPtzProfile(State& state) {
    return Fault(state, 400, "env:Sender", "ter:InvalidArgVal", "Profile has no PTZ configuration");
}

SoapReply GetPresets(State& state, pugi::xml_node request) {
    if (!PtzProfile(request)) return NoPtzProfile(state);
    std::vector<Preset> presets;
    {
        std::lock_guard<std::mutex> lock(state.mu);
        presets = state.presets;
    }
    std::string inner = "<tptz:GetPresetsResponse>";
    int i = 0;
    for (const Preset& p : presets) {
        char pos[200];
        snprintf(pos, sizeof pos,
                 "<tt:PTZPosition><tt:PanTilt x=\"%.2f\" y=\"0\"/><tt:Zoom x=\"0\"/>"
                 "</tt:PTZPosition>",
                 (i++ % 20) / 10.0 - 1.0);
        // A preset with an empty token is listed without the attribute.
        inner += "<tptz:Preset";
        if (!p.token.empty()) inner += " token=\"" + Escape(p.token) + "\"";
        inner += "><tt:Name>" + Escape(p.name) + "</tt:Name>" + pos + "</tptz:Preset>";
    }
    return Envelope(inner + "</tptz:GetPresetsResponse>");
}

SoapReply GotoPreset(State& state, pugi::xml_node request) {
    if (!PtzProfile(request)) return NoPtzProfile(state);
    std::string token = ChildText(request, "PresetToken");
    static const bool quiet = getenv("CAMSIM_QUIET") != nullptr;
    if (!quiet) fprintf(stderr, "camsim: GotoPreset token=\"%s\"\n", token.c_str());
    if (!token.empty() && token == state.Fault("refuse"))
        return Fault(state, 500, "env:Receiver", "ter:Action", "Preset refused");
    std::lock_guard<std::mutex> lock(state.mu);
    bool known = false;
    for (const Preset& p : state.presets) known = known || (!token.empty() && p.token == token);
    if (!known) {
        SoapReply r;
        r.status = -1;  // built below, outside the lock
        r.body = token;
        return r;
    }
    state.moves.push_back({token, state.Now()});
    state.current = token;
    return Envelope("<tptz:GotoPresetResponse/>");
}

SoapReply SetPreset(State& state, pugi::xml_node request) {
    if (!PtzProfile(request)) return NoPtzProfile(state);
    std::string token = ChildText(request, "PresetToken");
    std::string name = ChildText(request, "PresetName");
    std::lock_guard<std::mutex> lock(state.mu);
    if (!token.empty()) {
        for (Preset& p : state.presets)
            if (p.token == token) {
                if (!name.empty()) p.name = name;
                return Envelope("<tptz:SetPresetResponse><tptz:PresetToken>" + Escape(token) +
                                "</tptz:PresetToken></tptz:SetPresetResponse>");
            }
    } else {
        // New presets get the smallest free decimal token, as many cameras do.
        for (int n = 1;; ++n) {
            bool used = false;
            for (const Preset& p : state.presets) used = used || p.token == std::to_string(n);
            if (!used) {
                token = std::to_string(n);
                break;
            }
        }
    }
    if (name.empty()) name = "Preset " + token;
    state.presets.push_back({token, name});
    return Envelope("<tptz:SetPresetResponse><tptz:PresetToken>" + Escape(token) +
                    "</tptz:PresetToken></tptz:SetPresetResponse>");
}

SoapReply RemovePreset(State& state, pugi::xml_node request) {
    if (!PtzProfile(request)) return NoPtzProfile(state);
    std::string token = ChildText(request, "PresetToken");
    bool removed = false;
    {
        std::lock_guard<std::mutex> lock(state.mu);
        for (auto it = state.presets.begin(); it != state.presets.end(); ++it)
            if (it->token == token) {
                state.presets.erase(it);
                removed = true;
                break;
            }
    }
    if (!removed) return Fault(state, 400, "env:Sender", "ter:InvalidArgVal", "No such preset");
    return Envelope("<tptz:RemovePresetResponse/>");
}

SoapReply GetNodes() {
    return Envelope(
        "<tptz:GetNodesResponse><tptz:PTZNode token=\"PTZNode_1\" FixedHomePosition=\"false\">"
        "<tt:Name>PTZ</tt:Name><tt:SupportedPTZSpaces/><tt:MaximumNumberOfPresets>255"
        "</tt:MaximumNumberOfPresets><tt:HomeSupported>false</tt:HomeSupported>"
        "</tptz:PTZNode></tptz:GetNodesResponse>");
}

SoapReply GetStatus(State& state, pugi::xml_node request) {
    if (!PtzProfile(request)) return NoPtzProfile(state);
    return Envelope(
        "<tptz:GetStatusResponse><tptz:PTZStatus><tt:Position><tt:PanTilt x=\"0\" y=\"0\"/>"
        "<tt:Zoom x=\"0\"/></tt:Position><tt:MoveStatus><tt:PanTilt>IDLE</tt:PanTilt><tt:Zoom>"
        "IDLE</tt:Zoom></tt:MoveStatus></tptz:PTZStatus></tptz:GetStatusResponse>");
}

}  // namespace

std::string BaseAddress(State& state) {
    std::string internal = state.Fault("internal_address");
    if (!internal.empty()) return "http://" + internal;
    std::lock_guard<std::mutex> lock(state.mu);
    return "http://127.0.0.1:" + std::to_string(state.port);
}

std::string ServiceOfPath(State& state, const std::string& path) {
    if (path == "/onvif/device_service") return "device";
    if (path == MediaPath(state)) return "media";
    if (path == PtzPath(state)) return "ptz";
    return EventServiceOfPath(path);
}

SoapReply HandleSoap(State& state, const std::string& service, const std::string& body,
                     bool httpAuthorized) {
    if (state.Fault("garbage") == "1") {
        SoapReply r;
        r.body = "<<<this is not a SOAP reply";
        return r;
    }
    pugi::xml_document doc;
    if (!doc.load_string(body.c_str())) {
        // Digest clients send their first POST without a body; ask for credentials.
        if (!httpAuthorized) {
            SoapReply r;
            r.challenge = true;
            return r;
        }
        return Fault(state, 400, "env:Sender", "ter:WellFormed", "Not well formed");
    }
    pugi::xml_node envelope = doc.document_element();
    if (strcmp(LocalName(envelope.name()), "Envelope") != 0)
        return Fault(state, 400, "env:Sender", "ter:WellFormed", "No envelope");
    pugi::xml_node request;
    for (pugi::xml_node c = Child(envelope, "Body").first_child(); c; c = c.next_sibling())
        if (c.type() == pugi::node_element) {
            request = c;
            break;
        }
    if (!request) return Fault(state, 400, "env:Sender", "ter:WellFormed", "Empty body");
    std::string action = LocalName(request.name());

    bool open =
        service == "device" && action == "GetSystemDateAndTime" && state.Fault("time_auth") != "1";
    if (!open && !httpAuthorized) {
        if (state.Fault("http_auth_only") == "1") {
            SoapReply r;
            r.challenge = true;
            return r;
        }
        int token = CheckUsernameToken(state, Child(envelope, "Header"));
        if (token < 0)
            return Fault(state, 400, "env:Sender", "ter:NotAuthorized", "Sender not Authorized");
        if (token == 0) {
            SoapReply r;
            r.challenge = true;
            return r;
        }
    }

    if (service.rfind("events", 0) == 0) return HandleEvents(state, service, envelope, request);
    if (service == "device") {
        if (action == "GetSystemDateAndTime") return GetSystemDateAndTime(state);
        if (action == "GetCapabilities") return GetCapabilities(state);
        if (action == "GetServices") return GetServices(state);
        if (action == "GetDeviceInformation") return GetDeviceInformation(state);
        if (action == "GetScopes") return GetScopes();
    } else if (service == "media") {
        if (action == "GetProfiles") return GetProfiles();
        if (action == "GetProfile") return GetProfile(state, request);
        if (action == "GetVideoSources") return GetVideoSources();
        if (action == "GetSnapshotUri") return GetSnapshotUri(state, request);
        if (action == "GetStreamUri") return GetStreamUri(state, request);
    } else if (service == "ptz") {
        if (action == "GetPresets") return GetPresets(state, request);
        if (action == "GotoPreset") {
            SoapReply r = GotoPreset(state, request);
            if (r.status == -1)
                return Fault(state, 400, "env:Sender", "ter:InvalidArgVal", "No such preset");
            return r;
        }
        if (action == "SetPreset") return SetPreset(state, request);
        if (action == "RemovePreset") return RemovePreset(state, request);
        if (action == "GetNodes") return GetNodes();
        if (action == "GetStatus") return GetStatus(state, request);
    }
    return Fault(state, 500, "env:Receiver", "ter:ActionNotSupported", "Action not supported");
}

}  // namespace camsim
