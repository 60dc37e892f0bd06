// ONVIF SOAP 1.2 messages (see onvif_soap.h).
#include "hostlib/camera/onvif_soap.h"

#include <limits.h>
#include <openssl/evp.h>
#include <openssl/sha.h>
#include <string.h>

#include <cstdint>
#include <map>
#include <pugixml.hpp>
#include <string_view>
#include <utility>
#include <vector>

#include "hostlib/camera/onvif_xml.h"

namespace onvif {

const char* const kNsSoap = "http://www.w3.org/2003/05/soap-envelope";
const char* const kNsSchema = "http://www.onvif.org/ver10/schema";
const char* const kNsDevice = "http://www.onvif.org/ver10/device/wsdl";
const char* const kNsMedia = "http://www.onvif.org/ver10/media/wsdl";
const char* const kNsPtz = "http://www.onvif.org/ver20/ptz/wsdl";
const char* const kNsEvents = "http://www.onvif.org/ver10/events/wsdl";
const char* const kNsWsnt = "http://docs.oasis-open.org/wsn/b-2";
const char* const kNsTopics = "http://www.onvif.org/ver10/topics";

namespace {

const char* const kNsSoap11 = "http://schemas.xmlsoap.org/soap/envelope/";
const char* const kNsWsse =
    "http://docs.oasis-open.org/wss/2004/01/oasis-200401-wss-wssecurity-secext-1.0.xsd";
const char* const kNsWsu =
    "http://docs.oasis-open.org/wss/2004/01/oasis-200401-wss-wssecurity-utility-1.0.xsd";

using xml::Escape;
using xml::Namespaces;
using xml::Text;

std::string Request(const char* prefix, const char* ns, const char* name,
                    const std::string& inner = "") {
    std::string open = std::string(prefix) + ":" + name;
    if (inner.empty()) return "<" + open + " xmlns:" + prefix + "=\"" + ns + "\"/>";
    return "<" + open + " xmlns:" + prefix + "=\"" + ns + "\">" + inner + "</" + open + ">";
}

std::string Element(const char* prefix, const char* name, const std::string& value) {
    std::string tag = std::string(prefix) + ":" + name;
    return "<" + tag + ">" + Escape(value) + "</" + tag + ">";
}

uint32_t Fnv1a(const std::string& s) {
    uint32_t h = 2166136261u;
    for (unsigned char c : s) h = (h ^ c) * 16777619u;
    return h;
}

}  // namespace

// ---- requests ----

std::string Base64(const std::string& bytes) {
    std::string out(4 * ((bytes.size() + 2) / 3) + 1, '\0');
    int n = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(&out[0]),
                            reinterpret_cast<const unsigned char*>(bytes.data()),
                            static_cast<int>(bytes.size()));
    out.resize(n > 0 ? static_cast<size_t>(n) : 0);
    return out;
}

std::string PasswordDigest(const std::string& nonce, const std::string& created,
                           const std::string& password) {
    // The digest is fetched once: a fetch per call costs more than the hash.
    static EVP_MD* const sha1 = EVP_MD_fetch(nullptr, "SHA1", nullptr);
    std::string input = nonce + created + password;
    unsigned char d[SHA_DIGEST_LENGTH];
    unsigned int len = 0;
    if (!sha1 || !EVP_Digest(input.data(), input.size(), d, &len, sha1, nullptr)) return "";
    return Base64(std::string(reinterpret_cast<char*>(d), len));
}

std::string FormatUtc(time_t t) {
    struct tm tm;
    gmtime_r(&t, &tm);
    char buf[32];
    strftime(buf, sizeof buf, "%Y-%m-%dT%H:%M:%SZ", &tm);
    return buf;
}

std::string Envelope(const std::string& body, const UsernameToken* token,
                     const std::string& header) {
    std::string out =
        std::string("<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<s:Envelope xmlns:s=\"") +
        kNsSoap + "\">";
    if (token || !header.empty()) out += "<s:Header>" + header;
    if (token) {
        out += std::string("<wsse:Security s:mustUnderstand=\"1\" xmlns:wsse=\"") + kNsWsse +
               "\" xmlns:wsu=\"" + kNsWsu + "\"><wsse:UsernameToken>" +
               Element("wsse", "Username", token->user) +
               "<wsse:Password Type=\"http://docs.oasis-open.org/wss/2004/01/"
               "oasis-200401-wss-username-token-profile-1.0#PasswordDigest\">" +
               PasswordDigest(token->nonce, token->created, token->password) +
               "</wsse:Password><wsse:Nonce EncodingType=\"http://docs.oasis-open.org/wss/2004/01/"
               "oasis-200401-wss-soap-message-security-1.0#Base64Binary\">" +
               Base64(token->nonce) + "</wsse:Nonce>" + Element("wsu", "Created", token->created) +
               "</wsse:UsernameToken></wsse:Security>";
    }
    if (token || !header.empty()) out += "</s:Header>";
    out += "<s:Body>" + body + "</s:Body></s:Envelope>";
    return out;
}

std::string GetSystemDateAndTimeBody() { return Request("tds", kNsDevice, "GetSystemDateAndTime"); }
std::string GetServicesBody() {
    return Request("tds", kNsDevice, "GetServices", Element("tds", "IncludeCapability", "false"));
}
std::string GetCapabilitiesBody() {
    return Request("tds", kNsDevice, "GetCapabilities", Element("tds", "Category", "All"));
}
std::string GetProfilesBody() { return Request("trt", kNsMedia, "GetProfiles"); }
std::string GetSnapshotUriBody(const std::string& profile) {
    return Request("trt", kNsMedia, "GetSnapshotUri", Element("trt", "ProfileToken", profile));
}
std::string GetPresetsBody(const std::string& profile) {
    return Request("tptz", kNsPtz, "GetPresets", Element("tptz", "ProfileToken", profile));
}
std::string GotoPresetBody(const std::string& profile, const std::string& presetToken) {
    return Request(
        "tptz", kNsPtz, "GotoPreset",
        Element("tptz", "ProfileToken", profile) + Element("tptz", "PresetToken", presetToken));
}

std::string ActionOf(const std::string& body) {
    // Our own request text: "<p:Name xmlns:p=\"NS\"...".
    size_t colon = body.find(':');
    size_t end = body.find(' ');
    size_t q1 = body.find('"');
    size_t q2 = q1 == std::string::npos ? q1 : body.find('"', q1 + 1);
    if (colon == std::string::npos || end == std::string::npos || q2 == std::string::npos)
        return "";
    return body.substr(q1 + 1, q2 - q1 - 1) + "/" + body.substr(colon + 1, end - colon - 1);
}

// ---- replies ----

Reply::Reply() : impl_(new Impl) {}
Reply::~Reply() { delete impl_; }

bool Reply::Parse(const std::string& text) {
    const Namespaces& names = impl_->names;
    fault_.reset();
    impl_->body = pugi::xml_node();
    if (!impl_->doc.load_buffer(text.data(), text.size())) return false;
    impl_->names.Index(impl_->doc);
    pugi::xml_node envelope = impl_->doc.document_element();
    const char* soap = kNsSoap;
    if (!names.Matches(envelope, soap, "Envelope")) {
        soap = kNsSoap11;
        if (!names.Matches(envelope, soap, "Envelope")) return false;
    }
    pugi::xml_node body = names.Child(envelope, soap, "Body");
    if (!body) return false;
    for (pugi::xml_node c = body.first_child(); c; c = c.next_sibling())
        if (c.type() == pugi::node_element) {
            impl_->body = c;
            break;
        }
    if (!impl_->body) return false;
    if (names.Matches(impl_->body, soap, "Fault")) {
        Fault f;
        pugi::xml_node fault = impl_->body;
        if (soap == kNsSoap) {
            pugi::xml_node code = names.Child(fault, soap, "Code");
            f.code = Text(names.Child(code, soap, "Value"));
            f.subcode = Text(names.Child(names.Child(code, soap, "Subcode"), soap, "Value"));
            f.reason = Text(names.Child(names.Child(fault, soap, "Reason"), soap, "Text"));
        } else {  // SOAP 1.1: unqualified children
            f.code = Text(fault.child("faultcode"));
            f.reason = Text(fault.child("faultstring"));
        }
        fault_ = f;
    }
    return true;
}

bool Reply::Is(const char* ns, const char* local) const {
    const Namespaces& names = impl_->names;
    return !fault_ && names.Matches(impl_->body, ns, local);
}

std::optional<time_t> Reply::SystemDateAndTimeUtc() const {
    const Namespaces& names = impl_->names;
    if (!Is(kNsDevice, "GetSystemDateAndTimeResponse")) return std::nullopt;
    pugi::xml_node utc = names.Child(names.Child(impl_->body, kNsDevice, "SystemDateAndTime"),
                                     kNsSchema, "UTCDateTime");
    pugi::xml_node time = names.Child(utc, kNsSchema, "Time");
    pugi::xml_node date = names.Child(utc, kNsSchema, "Date");
    if (!time || !date) return std::nullopt;
    // The fields are checked before any arithmetic: a camera may send any int.
    const int year = names.Child(date, kNsSchema, "Year").text().as_int(0);
    const int month = names.Child(date, kNsSchema, "Month").text().as_int(0);
    struct tm tm = {};
    tm.tm_hour = names.Child(time, kNsSchema, "Hour").text().as_int(-1);
    tm.tm_min = names.Child(time, kNsSchema, "Minute").text().as_int(-1);
    tm.tm_sec = names.Child(time, kNsSchema, "Second").text().as_int(-1);
    tm.tm_mday = names.Child(date, kNsSchema, "Day").text().as_int(0);
    if (tm.tm_hour < 0 || tm.tm_hour > 23 || tm.tm_min < 0 || tm.tm_min > 59 || tm.tm_sec < 0 ||
        tm.tm_sec > 60 || year < 1970 || year > 9999 || month < 1 || month > 12 || tm.tm_mday < 1 ||
        tm.tm_mday > 31)
        return std::nullopt;
    tm.tm_year = year - 1900;
    tm.tm_mon = month - 1;
    time_t t = timegm(&tm);
    if (t == static_cast<time_t>(-1)) return std::nullopt;  // beyond time_t (32 bits: after 2038)
    return t;
}

Reply::Addresses Reply::Services() const {
    const Namespaces& names = impl_->names;
    Addresses a;
    if (!Is(kNsDevice, "GetServicesResponse")) return a;
    for (pugi::xml_node s : names.Children(impl_->body, kNsDevice, "Service")) {
        std::string ns = Text(names.Child(s, kNsDevice, "Namespace"));
        std::string xaddr = Text(names.Child(s, kNsDevice, "XAddr"));
        if (ns == kNsMedia && a.media.empty()) a.media = xaddr;
        if (ns == kNsPtz && a.ptz.empty()) a.ptz = xaddr;
        if (ns == kNsEvents && a.events.empty()) a.events = xaddr;
    }
    return a;
}

Reply::Addresses Reply::Capabilities() const {
    const Namespaces& names = impl_->names;
    Addresses a;
    if (!Is(kNsDevice, "GetCapabilitiesResponse")) return a;
    pugi::xml_node caps = names.Child(impl_->body, kNsDevice, "Capabilities");
    a.media = Text(names.Child(names.Child(caps, kNsSchema, "Media"), kNsSchema, "XAddr"));
    a.ptz = Text(names.Child(names.Child(caps, kNsSchema, "PTZ"), kNsSchema, "XAddr"));
    a.events = Text(names.Child(names.Child(caps, kNsSchema, "Events"), kNsSchema, "XAddr"));
    return a;
}

std::vector<Reply::Profile> Reply::Profiles() const {
    const Namespaces& names = impl_->names;
    std::vector<Profile> out;
    if (!Is(kNsMedia, "GetProfilesResponse")) return out;
    for (pugi::xml_node p : names.Children(impl_->body, kNsMedia, "Profiles")) {
        Profile profile;
        profile.token = p.attribute("token").as_string();
        if (profile.token.empty()) continue;
        profile.sourceToken = Text(names.Child(
            names.Child(p, kNsSchema, "VideoSourceConfiguration"), kNsSchema, "SourceToken"));
        pugi::xml_node reso = names.Child(names.Child(p, kNsSchema, "VideoEncoderConfiguration"),
                                          kNsSchema, "Resolution");
        profile.width = names.Child(reso, kNsSchema, "Width").text().as_int(0);
        profile.height = names.Child(reso, kNsSchema, "Height").text().as_int(0);
        profile.ptz = static_cast<bool>(names.Child(p, kNsSchema, "PTZConfiguration"));
        out.push_back(profile);
    }
    return out;
}

std::string Reply::SnapshotUri() const {
    const Namespaces& names = impl_->names;
    if (!Is(kNsMedia, "GetSnapshotUriResponse")) return "";
    return Text(names.Child(names.Child(impl_->body, kNsMedia, "MediaUri"), kNsSchema, "Uri"));
}

std::vector<Reply::Preset> Reply::Presets() const {
    const Namespaces& names = impl_->names;
    std::vector<Preset> out;
    if (!Is(kNsPtz, "GetPresetsResponse")) return out;
    for (pugi::xml_node p : names.Children(impl_->body, kNsPtz, "Preset")) {
        Preset preset;
        preset.token = p.attribute("token").as_string();
        if (preset.token.empty() || preset.token.size() > 64) continue;
        preset.name = Text(names.Child(p, kNsSchema, "Name"));
        out.push_back(preset);
    }
    return out;
}

// ---- positions, addresses ----

std::optional<int> DecimalToken(const std::string& token) {
    if (token.empty() || token.size() > 10) return std::nullopt;
    if (token.size() > 1 && token[0] == '0') return std::nullopt;
    long long v = 0;
    for (char c : token) {
        if (c < '0' || c > '9') return std::nullopt;
        v = v * 10 + (c - '0');
    }
    if (v > INT_MAX) return std::nullopt;
    return static_cast<int>(v);
}

int PresetPosition(const std::string& token) {
    if (auto v = DecimalToken(token)) return *v;
    return -1 - static_cast<int>(Fnv1a(token) & 0x7fffffffu);
}

std::string PresetToken(int position) {
    return position >= 0 ? std::to_string(position) : std::string();
}

std::map<int, std::string> MapPresets(const std::vector<Reply::Preset>& presets) {
    std::map<int, std::string> out;
    for (const Reply::Preset& p : presets) {
        int position = PresetPosition(p.token);
        if (position >= 0) {
            out.emplace(position, p.token);  // a repeated token keeps its first entry
            continue;
        }
        bool repeated = false;
        for (const auto& e : out) repeated = repeated || e.second == p.token;
        if (repeated) continue;
        while (out.count(position)) position = position == INT_MIN ? -1 : position - 1;
        out.emplace(position, p.token);
    }
    return out;
}

std::optional<Url> ParseUrl(const std::string& url) {
    Url u;
    size_t scheme = url.find("://");
    if (scheme == std::string::npos) return std::nullopt;
    u.scheme = url.substr(0, scheme);
    for (char& c : u.scheme) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
    size_t hostStart = scheme + 3;
    size_t pathStart = url.find_first_of("/?", hostStart);
    std::string authority = url.substr(
        hostStart, pathStart == std::string::npos ? std::string::npos : pathStart - hostStart);
    size_t at = authority.rfind('@');
    if (at != std::string::npos) authority = authority.substr(at + 1);
    std::string portText;
    if (!authority.empty() && authority[0] == '[') {  // [v6]:port
        size_t close = authority.find(']');
        if (close == std::string::npos) return std::nullopt;
        u.host = authority.substr(1, close - 1);
        if (close + 1 < authority.size() && authority[close + 1] == ':')
            portText = authority.substr(close + 2);
    } else {
        size_t colon = authority.find(':');
        u.host = authority.substr(0, colon);
        if (colon != std::string::npos) portText = authority.substr(colon + 1);
    }
    if (u.host.empty()) return std::nullopt;
    if (!portText.empty()) {
        for (char c : portText)
            if (c < '0' || c > '9') return std::nullopt;
        if (portText.size() > 5) return std::nullopt;
        u.port = atoi(portText.c_str());
        if (u.port <= 0 || u.port > 65535) return std::nullopt;
    } else {
        u.port = u.scheme == "https" ? 443 : 80;
    }
    u.path = pathStart == std::string::npos ? "/" : url.substr(pathStart);
    if (u.path[0] == '?') u.path = "/" + u.path;
    return u;
}

}  // namespace onvif
