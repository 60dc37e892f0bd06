// libFuzzer target for the multipart parser. The first bytes pick the
// boundary parameter, a small part limit and how the stream is split; the
// rest is the stream. Parsing it whole and split must give the same parts and
// the same end, and no part may exceed the limit.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

#include "hostlib/http/multipart_parser.h"

namespace {

using R = MultipartParser::Result;

struct Outcome {
    std::vector<MultipartPart> parts;
    R end;
};

Outcome Split(const std::string& stream, const std::string& boundary, size_t maxPart, uint8_t seed) {
    MultipartParser parser(boundary, maxPart);
    Outcome out;
    MultipartPart part;
    size_t at = 0;
    uint32_t state = seed * 2654435761u + 1;
    for (;;) {
        R r;
        while ((r = parser.Next(part)) == R::kPart) out.parts.push_back(part);
        if (r != R::kNeedMore) {
            out.end = r;
            return out;
        }
        if (at == stream.size()) {
            parser.End();
            continue;
        }
        state = state * 1103515245u + 12345u;
        size_t n = 1 + (state >> 16) % 64;
        if (n > stream.size() - at) n = stream.size() - at;
        parser.Feed(stream.data() + at, n);
        at += n;
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size < 2) return 0;
    static const char* const kBoundaries[] = {"frame", "--frame", "", "f"};
    std::string boundary = kBoundaries[data[0] & 3];
    size_t maxPart = (data[0] & 4) ? 64 : 4096;
    uint8_t seed = data[1];
    std::string stream(reinterpret_cast<const char*>(data + 2), size - 2);

    R wholeEnd;
    std::vector<MultipartPart> whole = ParseMultipart(stream, boundary, &wholeEnd, maxPart);
    Outcome split = Split(stream, boundary, maxPart, seed);
    if (split.end != wholeEnd || split.parts.size() != whole.size()) abort();
    for (size_t i = 0; i < whole.size(); ++i) {
        if (whole[i].content != split.parts[i].content || whole[i].headers != split.parts[i].headers) abort();
        if (whole[i].content.size() > maxPart) abort();
    }
    return 0;
}
