// ONVIF SOAP 1.2 messages: building requests and reading replies.
//
// Pure functions of text, no I/O, so every camera dialect can be tested as a
// table of replies. Replies are read namespace-aware: an element matches by
// its namespace URI and local name, whatever prefix (SOAP-ENV:, s:, env:, a
// default namespace) the camera chose.
//
// Preset positions. ONVIF names presets by tokens (strings up to 64
// characters); the library and its database name them by int positions.
// PresetPosition maps a token to a position the same way in every process:
//   - a canonical decimal token ("0", "1", "17": digits only, no sign, no
//     leading zero, at most INT_MAX) is that number, 0 .. INT_MAX;
//   - any other token ("Preset_1", "P001", "01", "-3", "99999999999") is
//     -1 - (FNV-1a-32(token bytes) & 0x7fffffff), a negative number in
//     INT_MIN .. -1, so it can never collide with a decimal token.
// PresetToken reverses only the decimal range; a negative position can be
// turned back into its token only with the camera's preset list (two text
// tokens of one camera with the same hash: the later in the list is taken to
// the next lower free number, see MapPresets).
#ifndef HOSTLIB_ONVIF_SOAP_H
#define HOSTLIB_ONVIF_SOAP_H

#include <time.h>

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace onvif {

extern const char* const kNsSoap;    // SOAP 1.2 envelope
extern const char* const kNsSchema;  // tt
extern const char* const kNsDevice;  // tds
extern const char* const kNsMedia;   // trt
extern const char* const kNsPtz;     // tptz

// ---- requests ----

struct UsernameToken {
    std::string user, password;
    std::string nonce;    // raw bytes (16 random bytes in practice)
    std::string created;  // UTC, "YYYY-MM-DDThh:mm:ssZ"
};

// PasswordDigest = Base64(SHA1(nonce + created + password)).
std::string PasswordDigest(const std::string& nonce, const std::string& created,
                           const std::string& password);
std::string Base64(const std::string& bytes);
// "YYYY-MM-DDThh:mm:ssZ" of a UTC time.
std::string FormatUtc(time_t t);

// A whole SOAP 1.2 envelope around `body` (one request element with its
// namespace declared), signed with `token` when given.
std::string Envelope(const std::string& body, const UsernameToken* token);

std::string GetSystemDateAndTimeBody();
std::string GetServicesBody();
std::string GetCapabilitiesBody();
std::string GetProfilesBody();
std::string GetSnapshotUriBody(const std::string& profile);
std::string GetPresetsBody(const std::string& profile);
std::string GotoPresetBody(const std::string& profile, const std::string& presetToken);

// The SOAP action URI of a request body's element (for the Content-Type).
std::string ActionOf(const std::string& body);

// ---- replies ----

struct Fault {
    std::string code, subcode, reason;  // subcode e.g. "ter:NotAuthorized" as the camera wrote it
};

// A parsed reply: the first element of the Body, or a fault.
class Reply {
public:
    // false: not XML, or not a SOAP envelope with a body.
    bool Parse(const std::string& text);
    bool IsFault() const { return fault_.has_value(); }
    const Fault& GetFault() const { return *fault_; }

    // nullopt: no UTCDateTime, or not a time (fields out of range, a year
    // outside 1970..9999, or beyond what time_t holds).
    std::optional<time_t> SystemDateAndTimeUtc() const;
    struct Addresses {
        std::string media, ptz;  // XAddr as reported; empty when absent
    };
    Addresses Services() const;      // from GetServicesResponse
    Addresses Capabilities() const;  // from GetCapabilitiesResponse
    struct Profile {
        std::string token, sourceToken;
        int width = 0, height = 0;  // of the video encoder; 0 when absent
        bool ptz = false;           // has a PTZ configuration
    };
    std::vector<Profile> Profiles() const;
    std::string SnapshotUri() const;  // "" when absent
    struct Preset {
        std::string token, name;
    };
    // Presets without a token, or with one longer than 64 characters, are left out.
    std::vector<Preset> Presets() const;
    // true when the body is the response element `local` in namespace `ns`.
    bool Is(const char* ns, const char* local) const;

    Reply();
    ~Reply();
    Reply(const Reply&) = delete;
    Reply& operator=(const Reply&) = delete;

private:
    struct Impl;
    Impl* impl_;
    std::optional<Fault> fault_;
};

// ---- positions, addresses ----

// See the header comment. nullopt: the token is not canonical decimal.
std::optional<int> DecimalToken(const std::string& token);
int PresetPosition(const std::string& token);
// Decimal text of a non-negative position; "" for a negative one.
std::string PresetToken(int position);
// Positions of a camera's preset list (in list order), text-token collisions
// resolved as said above: position -> token.
std::map<int, std::string> MapPresets(const std::vector<Reply::Preset>& presets);

struct Url {
    std::string scheme, host;
    int port = 0;      // the explicit port, else 80 for http and 443 for https
    std::string path;  // path with query, "/" at least
};
std::optional<Url> ParseUrl(const std::string& url);

}  // namespace onvif

#endif  // HOSTLIB_ONVIF_SOAP_H
