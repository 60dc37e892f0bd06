// camsim: internal interfaces between the HTTP server, the SOAP services and
// the image generator.
#ifndef TOOLS_CAMSIM_CAMSIM_H
#define TOOLS_CAMSIM_CAMSIM_H

#include <chrono>
#include <map>
#include <mutex>
#include <string>
#include <vector>

namespace camsim {

struct Preset {
    std::string token, name;
};

struct Move {
    std::string token;
    double seconds;  // on the simulator's monotonic clock
};

// Everything the simulator knows. Every field is guarded by `mu`; handlers
// take copies under the lock and never call out while holding it.
struct State {
    std::mutex mu;
    std::string user = "admin", password = "secret";
    int port = 0;                 // the port we listen on
    std::vector<Preset> presets;  // in the order the camera lists them
    std::vector<Move> moves;      // accepted GotoPreset requests
    std::map<std::string, std::string> faults;
    std::string current;  // token of the preset we are at ("" none yet)
    long requests = 0;    // requests received, control endpoints aside
    std::chrono::steady_clock::time_point start = std::chrono::steady_clock::now();

    std::string Fault(const std::string& name);  // "" when not set
    double Now() const;                          // seconds since start
};

// One SOAP reply.
struct SoapReply {
    int status = 200;
    std::string body;
    bool challenge = false;  // answer 401 with a digest challenge instead
};

// "http://host:port" that the camera advertises in its addresses (the
// internal_address fault, else where it listens).
std::string BaseAddress(State& state);

// Which service an endpoint path serves ("device", "media", "ptz", "events",
// "events:<path>" for an event subscription), or "".
std::string ServiceOfPath(State& state, const std::string& path);

// Handles one SOAP request to `service`. `httpAuthorized`: the request carried
// valid HTTP Digest credentials.
SoapReply HandleSoap(State& state, const std::string& service, const std::string& body,
                     bool httpAuthorized);

// A JPEG of `width` x `height` filled with the colour of preset `token`
// (grey for ""). Same token, same bytes.
std::string PresetJpeg(const std::string& token, int width, int height);
// The colour of a token: FNV-1a (32 bit) of its bytes, low three bytes as R, G, B.
void PresetColour(const std::string& token, unsigned char rgb[3]);

// Base64 and digests (OpenSSL).
std::string Base64Encode(const std::string& bytes);
std::string Base64Decode(const std::string& text);
std::string Sha1(const std::string& bytes);    // raw 20 bytes
std::string Md5Hex(const std::string& bytes);  // lowercase hex

}  // namespace camsim

#endif  // TOOLS_CAMSIM_CAMSIM_H
