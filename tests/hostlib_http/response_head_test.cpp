// Response heads: the pure reader as a table of heads, then the same shapes
// through the client from a scripted server on 127.0.0.1 (libcurl's own
// checks included).
#include "hostlib/http/response_head.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <thread>

#include "host/http.h"

namespace {

// Feeds `text` line by line, as libcurl does; "|" seals (a body began).
ResponseHead Read(const std::string& text) {
    ResponseHead head;
    size_t at = 0;
    while (at < text.size()) {
        if (text[at] == '|') {
            head.Seal();
            ++at;
            continue;
        }
        size_t nl = text.find('\n', at);
        size_t end = nl == std::string::npos ? text.size() : nl + 1;
        head.Line(text.data() + at, end - at);
        at = end;
    }
    return head;
}

std::string Describe(const ResponseHead& h) {
    if (h.Malformed()) return "malformed";
    const std::string* length = h.ContentLength();
    const std::string* type = h.Header("content-type");
    return std::to_string(h.Status()) + (h.Final() ? " final" : " open") +
           " length=" + (length ? *length : "-") + " type=" + (type ? *type : "-");
}

TEST(ResponseHead, HeadsAsCamerasAndServersSendThem) {
    struct Case {
        const char* head;
        const char* expected;
    } cases[] = {
        {"HTTP/1.1 200 OK\r\nContent-Type: image/jpeg\r\nContent-Length: 5\r\n\r\n",
         "200 final length=5 type=image/jpeg"},
        {"HTTP/1.0 200\nCONTENT-length :  7 \n\n",
         "200 final length=7 type=-"},  // LF only, no reason
        {"HTTP/1.1 200 OK\r\nContent-Type: image/jpeg\r\n", "200 open length=- type=image/jpeg"},
        // Interim and authentication heads are forgotten when the next one starts.
        {"HTTP/1.1 100 Continue\r\n\r\nHTTP/1.1 200 OK\r\nContent-Length: 3\r\n\r\n",
         "200 final length=3 type=-"},
        {"HTTP/1.1 401 Unauthorized\r\nContent-Type: text/html\r\nContent-Length: 9\r\n\r\n"
         "HTTP/1.1 200 OK\r\nContent-Length: 4\r\n\r\n",
         "200 final length=4 type=-"},
        {"HTTP/1.1 401 Unauthorized\r\nContent-Length: 9\r\n\r\n", "401 open length=9 type=-"},
        {"HTTP/1.1 401 Unauthorized\r\nContent-Length: 9\r\n\r\n|", "401 final length=9 type=-"},
        // Chunked: no framing length; trailers after the final head change nothing.
        {"HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\nContent-Length: 1\r\n\r\n"
         "Content-Length: 99\r\nContent-Type: x\r\n",
         "200 final length=- type=-"},
        {"HTTP/1.1 200 OK\r\nContent-Type: multipart/x-mixed-replace;\r\n\tboundary=frame\r\n\r\n",
         "200 final length=- type=multipart/x-mixed-replace; boundary=frame"},
        {"HTTP/1.1 200 OK\r\nContent-Length: 5\r\nContent-Length: 5\r\n\r\n",
         "200 final length=5 type=-"},
        {"HTTP/1.1 200 OK\r\nContent-Length: 5\r\nContent-Length: 10\r\n\r\n", "malformed"},
        {"HTTP/1.1 200 OK\r\nContent-Length: 5\r\n 0\r\n\r\n", "malformed"},
        {"HTTP/1.1 2000 OK\r\n\r\n", "malformed"},
        {"HTTP/1.1 20\r\n\r\n", "malformed"},
        {"HTTP/1.1 099 Low\r\n\r\n", "malformed"},
        {"HTTP/1.1  200 OK\r\n\r\n", "malformed"},
        {"HTTP/x 200 OK\r\n\r\n", "malformed"},
        {"Content-Length: 5\r\n\r\n", "0 open length=- type=-"},  // nothing before a status line
    };
    for (const Case& c : cases) EXPECT_EQ(Describe(Read(c.head)), c.expected) << c.head;

    // A head of endless header lines is refused once it passes the bound.
    ResponseHead head;
    head.Line("HTTP/1.1 200 OK\r\n", 17);
    const std::string line = "X-Filler-" + std::string(1000, 'a') + ": b\r\n";
    int lines = 0;
    for (; lines < 200 && !head.Malformed(); ++lines) {
        std::string numbered = std::to_string(lines) + line;
        head.Line(numbered.data(), numbered.size());
    }
    EXPECT_TRUE(head.Malformed());
    EXPECT_EQ(lines, 65);  // the 65th line of ~1 KiB passes 64 KiB
    EXPECT_EQ(head.Header("0x-filler-" + std::string(1000, 'a')), nullptr);  // all let go
}

// Serves `reply` to one connection on 127.0.0.1, then closes it.
class ScriptedServer {
public:
    explicit ScriptedServer(std::string reply) {
        fd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t len = sizeof addr;
        if (bind(fd_, reinterpret_cast<sockaddr*>(&addr), len) != 0 || listen(fd_, 1) != 0 ||
            getsockname(fd_, reinterpret_cast<sockaddr*>(&addr), &len) != 0)
            return;
        port_ = ntohs(addr.sin_port);
        thread_ = std::thread([this, reply] {
            pollfd p{fd_, POLLIN, 0};
            if (poll(&p, 1, 5000) != 1) return;
            int c = accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
            std::string request;
            char buf[4096];
            while (request.find("\r\n\r\n") == std::string::npos) {
                pollfd q{c, POLLIN, 0};
                ssize_t n = poll(&q, 1, 5000) == 1 ? read(c, buf, sizeof buf) : -1;
                if (n <= 0) break;
                request.append(buf, static_cast<size_t>(n));
            }
            (void)!write(c, reply.data(), reply.size());
            close(c);
        });
    }
    ~ScriptedServer() {
        if (thread_.joinable()) thread_.join();
        close(fd_);
    }
    int Port() const { return port_; }

private:
    int fd_ = -1;
    int port_ = 0;
    std::thread thread_;
};

TEST(ResponseHead, TheClientReportsWhatFramesTheBody) {
    struct Case {
        const char* reply;
        const char* expected;  // status, Content-Length, body; or "-1" when the head fails
    } cases[] = {
        {"HTTP/1.1 200 OK\r\nContent-Length: 5\r\n\r\nabcde", "200 5 abcde"},
        {"HTTP/1.1 100 Continue\r\n\r\nHTTP/1.1 200 OK\r\nContent-Length: 3\r\n\r\nabc",
         "200 3 abc"},
        {"HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\nContent-Length: 1\r\n\r\n"
         "3\r\nabc\r\n0\r\nContent-Length: 99\r\n\r\n",
         "200 - abc"},
        {"HTTP/1.1 200 OK\r\nContent-Length: 10\r\nContent-Length: 5\r\n\r\n0123456789", "-1"},
        {"HTTP/1.1 200 OK\r\nContent-Length: 5\r\nContent-Length: 10\r\n\r\n0123456789", "-1"},
    };
    for (const Case& c : cases) {
        ScriptedServer server(c.reply);
        ASSERT_NE(server.Port(), 0);
        OvHttpClient client("127.0.0.1", server.Port(), "/snap.jpg", "", "", 5);
        int status = 0;
        std::string got = "-1";
        if (client.SendRequest(OV_HTTP_GET) == 0 && client.CheckResponse(status) == 0) {
            std::string length = "-", body(100, '\0');
            client.GetHttpContent(HTTP_CONTENT_LENGTH, length);
            int n = client.ReadData(&body[0], static_cast<int>(body.size()));
            got = std::to_string(status) + " " + length + " " + body.substr(0, n > 0 ? n : 0);
        }
        EXPECT_EQ(got, c.expected) << c.reply;
    }
}

}  // namespace
