// libFuzzer target for the response head reader. The first byte says after
// which line the body begins (Seal; 255: never); the rest is split into lines
// at '\n' and fed as libcurl hands them over. The head must stay within its
// bound and keep what response_head.h promises.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "hostlib/http/response_head.h"

namespace {

void Check(bool ok) {
    if (!ok) abort();
}

bool Trimmed(const std::string& s) {
    return s.empty() || (s.front() != ' ' && s.front() != '\t' && s.back() != ' ' && s.back() != '\t');
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size < 1) return 0;
    const unsigned sealAfter = data[0];
    const char* text = reinterpret_cast<const char*>(data + 1);
    const char* end = text + size - 1;
    ResponseHead head;
    unsigned lines = 0;
    bool sealed = false;
    for (const char* at = text; at < end;) {
        const char* nl = static_cast<const char*>(memchr(at, '\n', end - at));
        const char* next = nl ? nl + 1 : end;
        head.Line(at, static_cast<size_t>(next - at));
        at = next;
        if (++lines == sealAfter) {
            head.Seal();
            sealed = true;
        }
        Check(head.Malformed() || head.Bytes() <= ResponseHead::kMaxBytes);
    }
    Check(head.Final() || !sealed);
    const int status = head.Status();
    Check(status == 0 || (status >= 100 && status <= 999));
    const std::string* length = head.ContentLength();
    const std::string* rawLength = head.Header("content-length");
    const std::string* encoding = head.Header("transfer-encoding");
    if (head.Malformed()) Check(status == 0 && !length && !rawLength && !encoding);
    if (length) Check(!encoding && rawLength == length);
    for (const std::string* v : {rawLength, encoding, head.Header("content-type")})
        if (v) Check(Trimmed(*v));
    return 0;
}
