// libFuzzer target for the ONVIF reply reader. The input is one reply: it is
// parsed once and read by every accessor (services, capabilities, profiles,
// snapshot URI, presets, system date and time, faults), and what they return
// goes on as the driver uses it (addresses through ParseUrl, preset tokens
// through MapPresets). Each result must keep the promises of onvif_soap.h.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "hostlib/camera/onvif_soap.h"

namespace {

void Check(bool ok) {
    if (!ok) abort();
}

void CheckUrl(const std::string& text) {
    auto url = onvif::ParseUrl(text);
    if (!url) return;
    Check(!url->host.empty() && url->port > 0 && url->port <= 65535);
    Check(!url->path.empty() && url->path[0] == '/');
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    onvif::Reply reply;
    if (!reply.Parse(std::string(reinterpret_cast<const char*>(data), size))) return 0;
    if (reply.IsFault()) {
        // Texts of the reply, trimmed: never longer than the reply itself.
        const onvif::Fault& f = reply.GetFault();
        Check(f.code.size() + f.subcode.size() + f.reason.size() <= size);
    }
    if (auto utc = reply.SystemDateAndTimeUtc()) {
        Check(*utc >= 0);
        Check(onvif::FormatUtc(*utc).size() == 20);  // YYYY-MM-DDThh:mm:ssZ
    }
    for (const onvif::Reply::Addresses& a : {reply.Services(), reply.Capabilities()}) {
        CheckUrl(a.media);
        CheckUrl(a.ptz);
    }
    for (const onvif::Reply::Profile& p : reply.Profiles()) Check(!p.token.empty());
    CheckUrl(reply.SnapshotUri());

    std::vector<onvif::Reply::Preset> presets = reply.Presets();
    std::set<std::string> tokens;
    for (const onvif::Reply::Preset& p : presets) {
        Check(!p.token.empty() && p.token.size() <= 64);
        tokens.insert(p.token);
    }
    // One position per distinct token; decimal tokens keep their number.
    std::map<int, std::string> positions = onvif::MapPresets(presets);
    Check(positions.size() == tokens.size());
    for (const auto& e : positions) {
        Check(tokens.count(e.second) == 1);
        if (e.first >= 0) Check(onvif::PresetToken(e.first) == e.second);
        if (e.first >= 0 || onvif::DecimalToken(e.second)) Check(onvif::PresetPosition(e.second) == e.first);
    }
    return 0;
}
