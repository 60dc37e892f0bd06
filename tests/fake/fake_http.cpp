#include "fake/fake_http.h"

#include <algorithm>
#include <cstring>
#include <mutex>

#include "fake/fake_host.h"
#include "host/http.h"

namespace fake {
namespace {

struct HttpState {
    std::mutex mu;
    HttpReply http;
    MultipartReply multipart;
    std::vector<HttpExchange> httpExchanges;
    std::vector<MultipartExchange> multipartExchanges;
};

HttpState& H() {
    static HttpState* state = new HttpState;
    return *state;
}

const ResetHook kReset([] {
    std::lock_guard<std::mutex> lock(H().mu);
    H().http = HttpReply{};
    H().multipart = MultipartReply{};
    H().httpExchanges.clear();
    H().multipartExchanges.clear();
});

}  // namespace

void SetHttpReply(const HttpReply& reply) {
    std::lock_guard<std::mutex> lock(H().mu);
    H().http = reply;
}

std::vector<HttpExchange> HttpExchanges() {
    std::lock_guard<std::mutex> lock(H().mu);
    return H().httpExchanges;
}

void SetMultipartReply(const MultipartReply& reply) {
    std::lock_guard<std::mutex> lock(H().mu);
    H().multipart = reply;
}

std::vector<MultipartExchange> MultipartExchanges() {
    std::lock_guard<std::mutex> lock(H().mu);
    return H().multipartExchanges;
}

}  // namespace fake

// ---- OvHttpClient ----

struct OvHttpClient::Impl {
    size_t index;              // into httpExchanges
    fake::HttpReply reply;     // the script when constructed
    long long delivered = 0;

    void Call(const std::string& what) {
        std::lock_guard<std::mutex> lock(fake::H().mu);
        fake::H().httpExchanges[index].calls.push_back(what);
    }
    long long BodySize() const {
        return reply.generatedBodySize >= 0 ? reply.generatedBodySize
                                            : static_cast<long long>(reply.body.size());
    }
};

OvHttpClient::OvHttpClient(const std::string& host, int port, const std::string& path,
                           const std::string& username, const std::string& password,
                           int timeoutSeconds)
    : impl_(std::make_unique<Impl>()) {
    std::lock_guard<std::mutex> lock(fake::H().mu);
    fake::HttpExchange e;
    e.host = host;
    e.port = port;
    e.path = path;
    e.username = username;
    e.password = password;
    e.timeout = timeoutSeconds;
    fake::H().httpExchanges.push_back(e);
    impl_->index = fake::H().httpExchanges.size() - 1;
    impl_->reply = fake::H().http;
}

OvHttpClient::~OvHttpClient() {
    std::lock_guard<std::mutex> lock(fake::H().mu);
    fake::H().httpExchanges[impl_->index].destroyed = true;
}

int OvHttpClient::SendRequest(OV_HTTP_METHOD method) {
    impl_->Call("SendRequest " + std::to_string(method));
    return impl_->reply.sendRc;
}

int OvHttpClient::CheckResponse(int& status) {
    impl_->Call("CheckResponse");
    if (impl_->reply.checkRc == 0) status = impl_->reply.status;
    return impl_->reply.checkRc;
}

int OvHttpClient::GetHttpContent(HTTP_MAP_KEY key, std::string& value) {
    impl_->Call("GetHttpContent " + std::to_string(key));
    if (key != HTTP_CONTENT_LENGTH || !impl_->reply.contentLength) return -1;
    value = *impl_->reply.contentLength;
    return 0;
}

int OvHttpClient::ReadData(char* buffer, int length) {
    impl_->Call("ReadData " + std::to_string(length));
    Impl& m = *impl_;
    long long n = std::min<long long>(length, m.BodySize() - m.delivered);
    if (m.reply.failAfter >= 0 && n > 0 && m.delivered + n > m.reply.failAfter) return -1;
    for (long long i = 0; i < n; ++i) {
        long long at = m.delivered + i;
        buffer[i] = static_cast<char>(m.reply.generatedBodySize >= 0 ? fake::PatternByte(at)
                                                                     : m.reply.body[at]);
    }
    m.delivered += n;
    return static_cast<int>(n);
}

// ---- MultipartFetch ----

struct MultipartFetch::Impl {
    size_t index;
    fake::MultipartReply reply;

    void Call(const std::string& what) {
        std::lock_guard<std::mutex> lock(fake::H().mu);
        fake::H().multipartExchanges[index].calls.push_back(what);
    }
};

MultipartFetch::MultipartFetch(const char* host, int port, const char* path, const char* username,
                               const char* password, int timeoutSeconds)
    : impl_(std::make_unique<Impl>()) {
    std::lock_guard<std::mutex> lock(fake::H().mu);
    fake::MultipartExchange e;
    e.host = host;
    e.port = port;
    e.path = path;
    e.username = username;
    e.password = password;
    e.timeout = timeoutSeconds;
    fake::H().multipartExchanges.push_back(e);
    impl_->index = fake::H().multipartExchanges.size() - 1;
    impl_->reply = fake::H().multipart;
}

MultipartFetch::~MultipartFetch() {
    std::lock_guard<std::mutex> lock(fake::H().mu);
    fake::H().multipartExchanges[impl_->index].destroyed = true;
}

int MultipartFetch::NextPartInfo(unsigned int& length, char* info, unsigned int infoSize) {
    impl_->Call("NextPartInfo " + std::to_string(infoSize));
    if (impl_->reply.nextRc != 0) return impl_->reply.nextRc;
    length = impl_->reply.length;
    if (infoSize > 0) {
        size_t n = std::min<size_t>(infoSize - 1, impl_->reply.info.size());
        memcpy(info, impl_->reply.info.data(), n);
        info[n] = '\0';
    }
    return 0;
}

int MultipartFetch::FetchContent(unsigned char* buffer, unsigned int length) {
    impl_->Call("FetchContent " + std::to_string(length));
    if (impl_->reply.fetchRc != 0) return impl_->reply.fetchRc;
    for (unsigned int i = 0; i < length; ++i) {
        buffer[i] = i < impl_->reply.content.size() ? static_cast<unsigned char>(impl_->reply.content[i])
                                                    : fake::PatternByte(i);
    }
    return 0;
}
