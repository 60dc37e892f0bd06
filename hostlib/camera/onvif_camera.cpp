// ONVIF camera driver (see onvif_camera.h).
#include "hostlib/camera/onvif_camera.h"

#include <curl/curl.h>
#include <stdlib.h>
#include <strings.h>
#include <sys/random.h>
#include <time.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <mutex>
#include <vector>

#include "hostlib/camera/onvif_soap.h"
#include "hostlib/http/curl_global.h"

namespace onvif {
namespace {

using Clock = std::chrono::steady_clock;

std::atomic<int> gCallTimeoutMs{5000};
const long kConnectTimeoutMs = 3000;
const size_t kMaxReply = 4 << 20;
const size_t kKeptHandles = 4;

// What is known about one camera; guarded by CameraEntry::mu.
struct Discovery {
    bool valid = false;
    std::string internalHost;  // host and port the camera names itself by
    int internalPort = 0;
    std::string mediaPath, ptzPath;
    std::vector<Reply::Profile> profiles;
    long clockOffset = 0;                         // camera UTC minus local clock, seconds
    std::map<int, std::string> textTokens;        // negative position -> token
    std::map<std::string, std::string> snapshot;  // profile -> snapshot URI
    std::map<std::string, int> snapshotType;      // profile -> fetch type, once probed
};

struct CameraEntry {
    std::mutex mu;
    Discovery known;
    std::vector<CURL*> handles;  // idle handles, each with its open connection
    ~CameraEntry() {
        for (CURL* h : handles) curl_easy_cleanup(h);
    }
};

std::mutex gCamerasMu;
std::map<std::string, std::shared_ptr<CameraEntry>>& Cameras() {
    static auto* cameras = new std::map<std::string, std::shared_ptr<CameraEntry>>;
    return *cameras;
}

std::shared_ptr<CameraEntry> EntryFor(const std::string& key) {
    HostCurlGlobalInit();
    std::lock_guard<std::mutex> lock(gCamerasMu);
    auto& e = Cameras()[key];
    if (!e) e = std::make_shared<CameraEntry>();
    return e;
}

size_t Collect(char* data, size_t size, size_t n, void* out) {
    auto* s = static_cast<std::string*>(out);
    if (s->size() + size * n > kMaxReply) return 0;  // a camera flooding us is a failure
    s->append(data, size * n);
    return size * n;
}

thread_local Diagnosis tLastDiagnosis;

// Headers of a probe: the Content-Type, lower case.
size_t ProbeHeader(char* data, size_t size, size_t n, void* out) {
    std::string line(data, size * n);
    if (strncasecmp(line.c_str(), "content-type:", 13) == 0) {
        std::string value = line.substr(13);
        for (char& c : value) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
        *static_cast<std::string*>(out) = value;
    }
    return size * n;
}

// The body of a probe is not wanted: the first byte ends the transfer.
size_t ProbeBody(char*, size_t, size_t, void*) { return 0; }

// kRefused: the camera failed the request (a fault, an error status, a reply
// we cannot read), which kept knowledge may explain; kAbsent: the camera's
// own fresh answer says the thing asked for does not exist.
enum class Outcome { kOk, kTransport, kRefused, kAbsent };

class OnvifCamera : public CameraAPI {
public:
    OnvifCamera(const std::string& host, int port, const std::string& user,
                const std::string& password, const std::string& channel)
        : host_(host),
          port_(port),
          user_(user),
          password_(password),
          entry_(EntryFor(host + ":" + std::to_string(port))) {
        long ch = strtol(channel.c_str(), nullptr, 10);
        channel_ = ch > 0 && ch < 1000 ? static_cast<int>(ch) : 1;
    }

    int SetReso(std::string reso) override {
        reso_ = reso;
        return 0;
    }

    int GetPresetList(std::map<int, std::string>& presets) override {
        return Run([&](Discovery& d) {
            std::vector<Reply::Preset> list;
            Outcome o = FetchPresets(d, list);
            if (o != Outcome::kOk) return o;
            presets.clear();
            for (const auto& e : MapPresets(list)) {
                for (const auto& p : list)
                    if (p.token == e.second) {
                        presets[e.first] = p.name;
                        break;
                    }
            }
            return Outcome::kOk;
        });
    }

    int GetSnapshotPath(std::string& path, int& port, int& type) override {
        return Run([&](Discovery& d) {
            const Reply::Profile* profile = SnapshotProfile(d);
            if (!profile)
                return Fail(Failure::kRefused,
                            "no media profile on channel " + std::to_string(channel_));
            std::string uri;
            auto cached = d.snapshot.find(profile->token);
            if (cached != d.snapshot.end()) {
                uri = cached->second;
            } else {
                Reply reply;
                Outcome o = Call(d.mediaPath, GetSnapshotUriBody(profile->token), true,
                                 d.clockOffset, reply);
                if (o != Outcome::kOk) return o;
                uri = reply.SnapshotUri();
                d.snapshot[profile->token] = uri;
                Store(d);
            }
            auto u = ParseUrl(uri);
            if (!u || u->scheme != "http")
                return Fail(Failure::kRefused, "snapshot URI is not http: " + uri);
            path = u->path;
            port = (u->host == d.internalHost && u->port == d.internalPort) ? port_ : u->port;
            auto known = d.snapshotType.find(profile->token);
            if (known != d.snapshotType.end()) {
                type = known->second;
            } else {
                type = ProbeSnapshotType(port, path);
                if (type > 0) {
                    d.snapshotType[profile->token] = type;
                    Store(d);
                }
                if (type < 0) type = 1;  // not known: the fetch itself will tell
            }
            return Outcome::kOk;
        });
    }

    int GoPreset(int position, std::string /*name*/) override {
        return Run([&](Discovery& d) {
            std::string token = PresetToken(position);
            if (token.empty()) {
                auto it = d.textTokens.find(position);
                if (it == d.textTokens.end()) {
                    std::vector<Reply::Preset> list;
                    Outcome o = FetchPresets(d, list);
                    if (o != Outcome::kOk) return o;
                    it = d.textTokens.find(position);
                    if (it == d.textTokens.end()) return Absent(position);
                }
                token = it->second;
            }
            const Reply::Profile* profile = PtzProfile(d);
            if (!profile || d.ptzPath.empty()) return NoPtz();
            Reply reply;
            return Call(d.ptzPath, GotoPresetBody(profile->token, token), true, d.clockOffset,
                        reply);
        });
    }

private:
    // Runs one operation within the call's time bound: with what is known
    // about the camera, discovering it first when nothing is; on a failure
    // with kept knowledge, forgets it, discovers afresh and tries once more.
    template <class Op>
    int Run(Op op) {
        problem_ = Diagnosis();
        const int rc = RunOnce(op);
        if (rc == 0) {
            tLastDiagnosis = Diagnosis();
        } else {
            if (problem_.failure == Failure::kNone)
                problem_ = {Failure::kRefused, "unexpected reply"};
            tLastDiagnosis = problem_;
        }
        return rc;
    }

    template <class Op>
    int RunOnce(Op op) {
        deadline_ = Clock::now() + std::chrono::milliseconds(gCallTimeoutMs.load());
        Discovery d;
        {
            std::lock_guard<std::mutex> lock(entry_->mu);
            d = entry_->known;
        }
        bool fresh = false;
        if (!d.valid) {
            if (Discover(d) != Outcome::kOk) return -1;
            fresh = true;
        }
        Outcome o = op(d);
        if (o == Outcome::kOk) return 0;
        if (o == Outcome::kAbsent) return -1;
        Forget();
        if (fresh || o == Outcome::kTransport) return -1;
        d = Discovery();
        if (Discover(d) != Outcome::kOk) return -1;
        return op(d) == Outcome::kOk ? 0 : -1;
    }

    void Store(const Discovery& d) {
        std::lock_guard<std::mutex> lock(entry_->mu);
        entry_->known = d;
    }

    void Forget() {
        std::lock_guard<std::mutex> lock(entry_->mu);
        entry_->known = Discovery();
    }

    Outcome Discover(Discovery& d) {
        const std::string device = "/onvif/device_service";
        Reply reply;
        // The camera's clock: asked unsigned first (many cameras answer only
        // that way), signed by the local clock when refused.
        d.clockOffset = 0;
        Outcome o = Call(device, GetSystemDateAndTimeBody(), false, 0, reply);
        if (o == Outcome::kTransport) return o;
        if (o != Outcome::kOk) o = Call(device, GetSystemDateAndTimeBody(), true, 0, reply);
        if (o == Outcome::kTransport) return o;
        if (o == Outcome::kOk) {
            if (auto utc = reply.SystemDateAndTimeUtc())
                d.clockOffset = static_cast<long>(*utc - time(nullptr));
        }

        Reply::Addresses a;
        o = Call(device, GetServicesBody(), true, d.clockOffset, reply);
        if (o == Outcome::kTransport) return o;
        if (o == Outcome::kOk) a = reply.Services();
        if (a.media.empty() || a.ptz.empty()) {
            Outcome c = Call(device, GetCapabilitiesBody(), true, d.clockOffset, reply);
            if (c == Outcome::kTransport) return c;
            if (c == Outcome::kOk) {
                Reply::Addresses b = reply.Capabilities();
                if (a.media.empty()) a.media = b.media;
                if (a.ptz.empty()) a.ptz = b.ptz;
            }
        }
        auto media = ParseUrl(a.media);
        if (!media) return Fail(Failure::kRefused, "no media service reported");
        d.mediaPath = media->path;
        d.internalHost = media->host;
        d.internalPort = media->port;
        auto ptz = ParseUrl(a.ptz);
        d.ptzPath = ptz ? ptz->path : std::string();

        o = Call(d.mediaPath, GetProfilesBody(), true, d.clockOffset, reply);
        if (o != Outcome::kOk) return o;
        d.profiles = reply.Profiles();
        if (d.profiles.empty()) return Fail(Failure::kRefused, "no media profile");
        d.valid = true;
        Store(d);
        return Outcome::kOk;
    }

    // The profiles of our channel, in the camera's order.
    std::vector<const Reply::Profile*> ChannelProfiles(const Discovery& d) const {
        std::vector<std::string> sources;
        for (const auto& p : d.profiles) {
            bool seen = false;
            for (const auto& s : sources) seen = seen || s == p.sourceToken;
            if (!seen) sources.push_back(p.sourceToken);
        }
        std::vector<const Reply::Profile*> out;
        if (channel_ > static_cast<int>(sources.size())) return out;
        for (const auto& p : d.profiles)
            if (p.sourceToken == sources[channel_ - 1]) out.push_back(&p);
        return out;
    }

    const Reply::Profile* PtzProfile(const Discovery& d) const {
        for (const Reply::Profile* p : ChannelProfiles(d))
            if (p->ptz) return p;
        return nullptr;
    }

    const Reply::Profile* SnapshotProfile(const Discovery& d) const {
        auto profiles = ChannelProfiles(d);
        if (profiles.empty()) return nullptr;
        int w = 0, h = 0;
        char x = 0;
        if (sscanf(reso_.c_str(), "%d%c%d", &w, &x, &h) == 3 && (x == 'x' || x == 'X'))
            for (const Reply::Profile* p : profiles)
                if (p->width == w && p->height == h) return p;
        return profiles[0];
    }

    Outcome FetchPresets(Discovery& d, std::vector<Reply::Preset>& list) {
        const Reply::Profile* profile = PtzProfile(d);
        if (!profile || d.ptzPath.empty()) return NoPtz();
        Reply reply;
        Outcome o = Call(d.ptzPath, GetPresetsBody(profile->token), true, d.clockOffset, reply);
        if (o != Outcome::kOk) return o;
        if (!reply.Is(kNsPtz, "GetPresetsResponse"))
            return Fail(Failure::kRefused, "GetPresets: unexpected reply");
        list = reply.Presets();
        d.textTokens.clear();
        for (const auto& e : MapPresets(list))
            if (e.first < 0) d.textTokens.insert(e);
        Store(d);
        return Outcome::kOk;
    }

    // One SOAP request to `path` on the configured host and port.
    Outcome Call(const std::string& path, const std::string& body, bool sign, long offset,
                 Reply& reply) {
        long left = static_cast<long>(
            std::chrono::duration_cast<std::chrono::milliseconds>(deadline_ - Clock::now())
                .count());
        if (left <= 0) {
            Fail(Failure::kUnreachable,
                 "no answer within " + std::to_string(gCallTimeoutMs.load()) + " ms");
            return Outcome::kTransport;
        }
        std::string xml;
        if (sign && !user_.empty()) {
            UsernameToken token;
            token.user = user_;
            token.password = password_;
            // The kernel's random bytes: a fresh, unpredictable nonce without
            // the cost of a user-space generator per request.
            unsigned char nonce[16];
            if (getrandom(nonce, sizeof nonce, 0) != static_cast<ssize_t>(sizeof nonce))
                return Outcome::kRefused;
            token.nonce.assign(reinterpret_cast<char*>(nonce), sizeof nonce);
            token.created = FormatUtc(time(nullptr) + offset);
            xml = Envelope(body, &token);
        } else {
            xml = Envelope(body, nullptr);
        }

        CURL* curl = nullptr;
        {
            std::lock_guard<std::mutex> lock(entry_->mu);
            if (!entry_->handles.empty()) {
                curl = entry_->handles.back();
                entry_->handles.pop_back();
            }
        }
        if (!curl) curl = curl_easy_init();
        if (!curl) return Outcome::kTransport;
        // A kept handle is not reset: it keeps what HTTP authentication
        // learnt (a reset costs every POST an extra wait). Every option that
        // can differ between requests is set below, each time.

        std::string url = "http://" +
                          (host_.find(':') != std::string::npos ? "[" + host_ + "]" : host_) + ":" +
                          std::to_string(port_) + path;
        std::string contentType =
            "Content-Type: application/soap+xml; charset=utf-8; action=\"" + ActionOf(body) + "\"";
        struct curl_slist* headers = curl_slist_append(nullptr, contentType.c_str());
        headers = curl_slist_append(headers, "Expect:");
        std::string text;
        curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
        curl_easy_setopt(curl, CURLOPT_POSTFIELDS, xml.c_str());
        curl_easy_setopt(curl, CURLOPT_POSTFIELDSIZE, static_cast<long>(xml.size()));
        curl_easy_setopt(curl, CURLOPT_HTTPHEADER, headers);
        curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, Collect);
        curl_easy_setopt(curl, CURLOPT_WRITEDATA, &text);
        SetBoundsAndCredentials(curl, left);
        CURLcode rc = curl_easy_perform(curl);
        long status = 0;
        curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
        // No pointer into this call's buffers stays in a kept handle.
        curl_easy_setopt(curl, CURLOPT_HTTPHEADER, static_cast<curl_slist*>(nullptr));
        curl_easy_setopt(curl, CURLOPT_POSTFIELDS, static_cast<char*>(nullptr));
        curl_easy_setopt(curl, CURLOPT_WRITEDATA, static_cast<void*>(nullptr));
        curl_slist_free_all(headers);
        {
            std::lock_guard<std::mutex> lock(entry_->mu);
            if (rc == CURLE_OK && entry_->handles.size() < kKeptHandles) {
                entry_->handles.push_back(curl);
                curl = nullptr;
            }
        }
        if (curl) curl_easy_cleanup(curl);

        const std::string action = ActionOf(body);
        const std::string what = action.substr(action.rfind('/') + 1);
        if (rc != CURLE_OK) {
            // No connection, or no answer in time; otherwise the camera
            // answered and broke off.
            const bool silent = rc == CURLE_COULDNT_CONNECT || rc == CURLE_COULDNT_RESOLVE_HOST ||
                                rc == CURLE_OPERATION_TIMEDOUT;
            Fail(silent ? Failure::kUnreachable : Failure::kRefused,
                 url + ": " + curl_easy_strerror(rc));
            return Outcome::kTransport;
        }
        if (status == 401 || status == 403)
            return Fail(Failure::kUnauthorized, what + ": HTTP " + std::to_string(status));
        if (!reply.Parse(text))
            return Fail(Failure::kRefused,
                        what + ": HTTP " + std::to_string(status) + ", not a SOAP reply");
        if (reply.IsFault()) {
            const Fault& f = reply.GetFault();
            const bool auth = (f.subcode + f.code).find("NotAuthorized") != std::string::npos;
            return Fail(auth ? Failure::kUnauthorized : Failure::kRefused,
                        what + ": SOAP fault " + (f.subcode.empty() ? f.code : f.subcode) +
                            (f.reason.empty() ? "" : " (" + f.reason + ")"));
        }
        if (status < 200 || status > 299)
            return Fail(Failure::kRefused, what + ": HTTP " + std::to_string(status));
        return Outcome::kOk;
    }

    // Notes why the call fails: the latest failure explains it best, except
    // that a refused credential is not hidden by what follows from it (no
    // service address when GetServices and GetCapabilities were refused).
    Outcome Fail(Failure failure, const std::string& detail) {
        if (!(problem_.failure == Failure::kUnauthorized && failure == Failure::kRefused))
            problem_ = {failure, detail};
        return Outcome::kRefused;
    }
    Outcome NoPtz() {
        return Fail(Failure::kRefused, "no PTZ unit on channel " + std::to_string(channel_));
    }
    Outcome Absent(int position) {
        problem_ = {Failure::kNoSuchPreset, "the camera has no preset " + std::to_string(position)};
        return Outcome::kAbsent;
    }

    // The options every request of a call sets: its time bound (`left` ms),
    // no signals, no proxy, and the camera's credentials for HTTP Digest or
    // Basic (none without a user name; a kept handle forgets earlier ones).
    void SetBoundsAndCredentials(CURL* curl, long left) const {
        curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
        curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, left);
        curl_easy_setopt(curl, CURLOPT_CONNECTTIMEOUT_MS, std::min(left, kConnectTimeoutMs));
        curl_easy_setopt(curl, CURLOPT_NOPROXY, "*");
        if (!user_.empty()) {
            curl_easy_setopt(curl, CURLOPT_HTTPAUTH, CURLAUTH_DIGEST | CURLAUTH_BASIC);
            curl_easy_setopt(curl, CURLOPT_USERNAME, user_.c_str());
            curl_easy_setopt(curl, CURLOPT_PASSWORD, password_.c_str());
        } else {
            curl_easy_setopt(curl, CURLOPT_HTTPAUTH, CURLAUTH_NONE);
            curl_easy_setopt(curl, CURLOPT_USERNAME, static_cast<char*>(nullptr));
            curl_easy_setopt(curl, CURLOPT_PASSWORD, static_cast<char*>(nullptr));
        }
    }

    // What the snapshot URI serves, from the Content-Type of its response: 2
    // for a multipart stream (some cameras give their MJPEG stream as the
    // snapshot URI), 1 for anything else; -1 when no response came. One GET
    // within the call's time bound, ended at the first body byte.
    int ProbeSnapshotType(int port, const std::string& path) {
        long left = static_cast<long>(
            std::chrono::duration_cast<std::chrono::milliseconds>(deadline_ - Clock::now())
                .count());
        if (left <= 0) return -1;
        CURL* curl = curl_easy_init();
        if (!curl) return -1;
        std::string url = "http://" +
                          (host_.find(':') != std::string::npos ? "[" + host_ + "]" : host_) + ":" +
                          std::to_string(port) + path;
        std::string contentType;
        curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
        curl_easy_setopt(curl, CURLOPT_HEADERFUNCTION, ProbeHeader);
        curl_easy_setopt(curl, CURLOPT_HEADERDATA, &contentType);
        curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, ProbeBody);
        SetBoundsAndCredentials(curl, left);
        const CURLcode rc = curl_easy_perform(curl);
        long status = 0;
        curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
        curl_easy_cleanup(curl);
        if ((rc != CURLE_OK && rc != CURLE_WRITE_ERROR) || status != 200) return -1;
        return contentType.find("multipart/") != std::string::npos ? 2 : 1;
    }

    std::string host_;
    int port_;
    std::string user_, password_;
    int channel_ = 1;
    std::string reso_;
    std::shared_ptr<CameraEntry> entry_;
    Clock::time_point deadline_;
    Diagnosis problem_;  // why the call in progress fails
};

}  // namespace

CameraAPI* NewOnvifCamera(const std::string& host, int port, const std::string& username,
                          const std::string& password, const std::string& channel) {
    return new OnvifCamera(host, port, username, password, channel);
}

Diagnosis LastDiagnosis() { return tLastDiagnosis; }

void SetCallTimeoutMs(int ms) { gCallTimeoutMs = ms > 0 ? ms : 1; }
int CallTimeoutMs() { return gCallTimeoutMs.load(); }

void ForgetCameras() {
    std::lock_guard<std::mutex> lock(gCamerasMu);
    Cameras().clear();
}

}  // namespace onvif
