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

#include <cstddef>
#include <cstdint>
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
extern const char* const kNsEvents;  // tev
extern const char* const kNsWsnt;    // wsnt: WS-BaseNotification
extern const char* const kNsTopics;  // tns1: the ONVIF topic namespace

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
// namespace declared), signed with `token` when given. `header`: further
// header blocks (whole elements with their namespaces declared), put before
// the security block.
std::string Envelope(const std::string& body, const UsernameToken* token,
                     const std::string& header = std::string());

std::string GetSystemDateAndTimeBody();
std::string GetServicesBody();
std::string GetCapabilitiesBody();
std::string GetProfilesBody();
std::string GetSnapshotUriBody(const std::string& profile);
std::string GetPresetsBody(const std::string& profile);
std::string GotoPresetBody(const std::string& profile, const std::string& presetToken);

// The SOAP action URI of a request body's element (for the Content-Type).
// Not for the event requests below, whose actions are EventAction's.
std::string ActionOf(const std::string& body);

// ---- event requests (PullPoint) ----
// Durations are whole seconds, sent as "PT<n>S" (at least 1).

enum class EventCall {
    kCreatePullPointSubscription,  // to the event service
    kPullMessages,                 // the rest to the subscription
    kSetSynchronizationPoint,
    kRenew,
    kUnsubscribe,
};
// `seconds`: the termination asked for (create, renew) or the pull's
// timeout; `limit`: the pull's message limit.
std::string EventBody(EventCall call, int seconds = 0, int limit = 0);
const char* EventAction(EventCall call);
// The header blocks of a request on a subscription: WS-Addressing Action and
// To (the subscription's address as the camera gave it) and the reference
// parameters it gave with it, which identify the subscription on some cameras.
std::string SubscriptionHeader(EventCall call, const std::string& to,
                               const std::string& referenceParameters);

// ---- replies ----

struct Fault {
    std::string code, subcode, reason;  // subcode e.g. "ter:NotAuthorized" as the camera wrote it
};

struct Notification;  // see below

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
        std::string media, ptz, events;  // XAddr as reported; empty when absent
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

    // ---- event replies (onvif_event_soap.cpp) ----
    // Times are microseconds since the epoch on the camera's clock; absent
    // when missing or unreadable.
    struct Subscription {
        std::string address;              // "" when absent
        std::string referenceParameters;  // children, serialised with their namespaces
        std::optional<int64_t> current, termination;
    };
    // From a CreatePullPointSubscriptionResponse.
    Subscription PullPointSubscription() const;
    // CurrentTime and TerminationTime of a PullMessagesResponse or RenewResponse.
    Subscription Termination() const;
    // The notification messages of a PullMessagesResponse, in order: at most
    // kMaxNotifications (`dropped`, when given, counts the rest); see
    // Notification for the per-message limits. Messages without a topic or
    // a Message element are left out (and counted as dropped).
    std::vector<Notification> Notifications(size_t* dropped = nullptr) const;

    Reply();
    ~Reply();
    Reply(const Reply&) = delete;
    Reply& operator=(const Reply&) = delete;

private:
    struct Impl;
    Impl* impl_;
    std::optional<Fault> fault_;
};

// ---- event messages ----

constexpr size_t kMaxNotifications = 64;     // kept of one pull
constexpr size_t kMaxTopicChars = 256;       // longer topics (or 4x that resolved): dropped
constexpr size_t kMaxItemChars = 128;        // names and values: longer ones are cut
constexpr size_t kMaxItems = 8;              // source and data items kept, each
constexpr size_t kMaxReferenceChars = 2048;  // reference parameters: longer ones are dropped

// One notification message. The topic is read as a concrete topic
// expression: its root's prefix resolved with the namespaces in scope at the
// Topic element, so "tns1:VideoSource/MotionAlarm" and
// "x:VideoSource/MotionAlarm" with x bound to the ONVIF topic namespace are
// the same topic. A root without a prefix has the namespace "". "tns1" left
// undeclared is taken as the ONVIF topic namespace. Later segments with a
// prefix of another namespace read "{uri}local".
struct Notification {
    std::string topicNs;  // namespace URI of the topic's root
    std::string topic;    // the path, "VideoSource/MotionAlarm"
    enum class Op { kChanged, kInitialized, kDeleted } op = Op::kChanged;  // PropertyOperation
    std::optional<int64_t> utc;  // UtcTime, microseconds since the epoch
    using Items = std::vector<std::pair<std::string, std::string>>;  // SimpleItem Name, Value
    Items source, data;
};

// An xs:dateTime ("2024-05-06T07:08:09Z", fractions, "+hh:mm" zones; no zone
// is UTC) in microseconds since the epoch.
std::optional<int64_t> ParseDateTime(const std::string& text);
// A boolean item value: "true"/"false" in any case, "1"/"0"; spaces around.
std::optional<bool> ParseBool(const std::string& text);

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
