// The host's HTTP transport: OvHttpClient (one request, body read on demand)
// and MultipartFetch (parts of a multipart/x-mixed-replace stream), both over
// CurlTransfer.
#include <algorithm>
#include <climits>
#include <cstring>

#include "host/http.h"
#include "hostlib/http/curl_transfer.h"
#include "hostlib/http/multipart_parser.h"

struct OvHttpClient::Impl {
    CurlTransfer::Request request;
    CurlTransfer transfer;
    bool sent = false;
    bool answered = false;
};

OvHttpClient::OvHttpClient(const std::string& host, int port, const std::string& path,
                           const std::string& username, const std::string& password,
                           int timeoutSeconds)
    : impl_(std::make_unique<Impl>()) {
    impl_->request.host = host;
    impl_->request.port = port;
    impl_->request.path = path;
    impl_->request.username = username;
    impl_->request.password = password;
    impl_->request.timeoutSeconds = timeoutSeconds;
}

OvHttpClient::~OvHttpClient() = default;

int OvHttpClient::SendRequest(OV_HTTP_METHOD method) {
    if (impl_->sent) return -1;
    impl_->sent = true;
    impl_->request.post = method == OV_HTTP_POST;
    return impl_->transfer.Start(impl_->request) ? 0 : -1;
}

int OvHttpClient::CheckResponse(int& status) {
    if (!impl_->sent || !impl_->transfer.WaitHeaders()) return -1;
    impl_->answered = true;
    status = impl_->transfer.Status();
    return 0;
}

int OvHttpClient::GetHttpContent(HTTP_MAP_KEY key, std::string& value) {
    if (!impl_->answered) return -1;
    const std::string* found = nullptr;
    switch (key) {
    case HTTP_CONTENT_TYPE:
        found = impl_->transfer.Header("content-type");
        break;
    case HTTP_CONTENT_LENGTH:
        found = impl_->transfer.ContentLength();
        break;
    }
    if (found == nullptr) return -1;
    value = *found;
    return 0;
}

int OvHttpClient::ReadData(char* buffer, int length) {
    if (!impl_->sent || buffer == nullptr || length < 0) return -1;
    return static_cast<int>(impl_->transfer.Read(buffer, static_cast<size_t>(length), true));
}

struct MultipartFetch::Impl {
    static constexpr size_t kChunk = 65536;

    CurlTransfer::Request request;
    CurlTransfer transfer;
    std::unique_ptr<MultipartParser> parser;
    bool failed = false;
    MultipartPart part;     // the current part
    size_t partRead = 0;    // bytes of it handed out by FetchContent

    bool Open() {
        if (!transfer.Start(request) || !transfer.WaitHeaders() || transfer.Status() != 200)
            return false;
        const std::string* type = transfer.Header("content-type");
        parser = std::make_unique<MultipartParser>(type ? MultipartBoundary(*type) : std::string());
        return true;
    }

    bool NextPart() {
        std::string chunk(kChunk, '\0');
        for (;;) {
            switch (parser->Next(part)) {
            case MultipartParser::Result::kPart:
                partRead = 0;
                return true;
            case MultipartParser::Result::kEnd:
            case MultipartParser::Result::kError:
                return false;
            case MultipartParser::Result::kNeedMore:
                break;
            }
            long n = transfer.Read(&chunk[0], chunk.size(), false);
            if (n < 0) return false;
            if (n == 0) {
                parser->End();
            } else {
                parser->Feed(chunk.data(), static_cast<size_t>(n));
            }
        }
    }
};

MultipartFetch::MultipartFetch(const char* host, int port, const char* path, const char* username,
                               const char* password, int timeoutSeconds)
    : impl_(std::make_unique<Impl>()) {
    impl_->request.host = host ? host : "";
    impl_->request.port = port;
    impl_->request.path = path ? path : "";
    impl_->request.username = username ? username : "";
    impl_->request.password = password ? password : "";
    impl_->request.timeoutSeconds = timeoutSeconds;
}

MultipartFetch::~MultipartFetch() = default;

int MultipartFetch::NextPartInfo(unsigned int& length, char* info, unsigned int infoSize) {
    Impl& m = *impl_;
    if (m.failed) return -1;
    // The first part's time runs from the connect (Open), each later part's
    // from this call: a stream may run as long as its parts come in time.
    if (m.parser) {
        m.transfer.RestartDeadline();
    } else if (!m.Open()) {
        m.failed = true;
        return -1;
    }
    if (!m.NextPart() || m.part.content.size() > UINT_MAX) {
        m.failed = true;
        return -1;
    }
    length = static_cast<unsigned int>(m.part.content.size());
    if (info != nullptr && infoSize > 0) {
        size_t n = std::min<size_t>(infoSize - 1, m.part.headers.size());
        memcpy(info, m.part.headers.data(), n);
        info[n] = '\0';
    }
    return 0;
}

int MultipartFetch::FetchContent(unsigned char* buffer, unsigned int length) {
    Impl& m = *impl_;
    if (m.failed || !m.parser || length > m.part.content.size() - m.partRead) return -1;
    if (length > 0) {
        if (buffer == nullptr) return -1;
        memcpy(buffer, m.part.content.data() + m.partRead, length);
    }
    m.partRead += length;
    if (m.partRead == m.part.content.size()) {  // all handed out: let it go
        m.part.content.clear();
        m.part.content.shrink_to_fit();
        m.partRead = 0;
    }
    return 0;
}
