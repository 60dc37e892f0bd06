// Cost of reading an ONVIF reply against the cost of parsing its XML alone
// (the floor: pugixml's load of the same text), for a preset list as cameras
// send it and for a hostile one of the same size class: 20000 namespace
// declarations on the response element and 20000 presets under it, each with
// its own prefix. Goal: the hostile ratio no higher than the plain one (both
// about 20 here: reading copies every text, parsing copies none). A name
// lookup that scans the ancestors' attributes for every element made the
// hostile ratio 866, growing with the square of the size (minutes for a
// 4 MiB reply).
//
//   build/bench/camera/onvif_reply_bench
#include <benchmark/benchmark.h>

#include <pugixml.hpp>
#include <string>

#include "bench/ratio_reporter.h"
#include "hostlib/camera/onvif_soap.h"

namespace {

const char* const kOpen =
    "<s:Envelope xmlns:s=\"http://www.w3.org/2003/05/soap-envelope\"><s:Body>";
const char* const kPtz = "\"http://www.onvif.org/ver20/ptz/wsdl\"";
const char* const kTt = "\"http://www.onvif.org/ver10/schema\"";

// `n` presets as a camera lists them.
std::string Plain(int n) {
    std::string s = std::string(kOpen) + "<tptz:GetPresetsResponse xmlns:tptz=" + kPtz +
                    " xmlns:tt=" + kTt + ">";
    for (int i = 0; i < n; ++i)
        s += "<tptz:Preset token=\"" + std::to_string(i) + "\"><tt:Name>Preset " +
             std::to_string(i) + "</tt:Name></tptz:Preset>";
    return s + "</tptz:GetPresetsResponse></s:Body></s:Envelope>";
}

// `n` prefixes declared on the response element, then `n` presets, each
// named with one of them.
std::string Hostile(int n) {
    std::string s = std::string(kOpen) + "<p0:GetPresetsResponse";
    for (int i = 0; i < n; ++i) s += " xmlns:p" + std::to_string(i) + "=" + kPtz;
    s += ">";
    for (int i = 0; i < n; ++i) {
        std::string p = "p" + std::to_string(i);
        s += "<" + p + ":Preset token=\"" + std::to_string(i) + "\"/>";
    }
    return s + "</p0:GetPresetsResponse></s:Body></s:Envelope>";
}

void Read(benchmark::State& state, std::string (*make)(int)) {
    const std::string text = make(static_cast<int>(state.range(0)));
    for (auto _ : state) {
        onvif::Reply reply;
        if (!reply.Parse(text) || reply.Presets().size() != static_cast<size_t>(state.range(0)))
            state.SkipWithError("reply not read");
    }
}

void ParseOnly(benchmark::State& state, std::string (*make)(int)) {
    const std::string text = make(static_cast<int>(state.range(0)));
    for (auto _ : state) {
        pugi::xml_document doc;
        benchmark::DoNotOptimize(doc.load_buffer(text.data(), text.size()));
    }
}

}  // namespace

int main(int argc, char** argv) {
    for (auto [name, make] : {std::pair{"Plain", Plain}, std::pair{"Hostile", Hostile}}) {
        std::string base = std::string("ReadReply") + name + "20000";
        benchmark::RegisterBenchmark((base + "/baseline").c_str(), ParseOnly, make)->Arg(20000);
        benchmark::RegisterBenchmark((base + "/ours").c_str(), Read, make)->Arg(20000);
    }
    benchmark::Initialize(&argc, argv);
    RatioReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    benchmark::Shutdown();
    return 0;
}
