// OvHttpClient and MultipartFetch against a scripted server on 127.0.0.1:
// each case is a canned reply (with pauses, stalls and drops) and the results
// the client must give.
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <thread>

#include "host/http.h"
#include "local_servers.h"

namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;
using testsrv::ScriptServer;

std::string Head(const std::string& extra) { return "HTTP/1.1 200 OK\r\n" + extra + "\r\n"; }

double SecondsSince(Clock::time_point t) { return std::chrono::duration<double>(Clock::now() - t).count(); }

// Reads a body to its end in asks of `ask` bytes; `first` gets the first read's result.
std::string ReadAll(OvHttpClient& client, int ask, int* result, int* first) {
    std::string out;
    std::string buf(ask, '\0');
    int n;
    *first = client.ReadData(&buf[0], ask);
    for (n = *first; n > 0; n = client.ReadData(&buf[0], ask)) out.append(buf, 0, n);
    *result = n;
    return out;
}

TEST(OvHttpClient, BodiesOfEveryFraming) {
    const std::string body = testsrv::JpegLike(70001, 2);
    std::string chunked;
    for (size_t at = 0; at < body.size(); at += 30000) {
        std::string piece = body.substr(at, 30000);
        char size[32];
        snprintf(size, sizeof size, "%zx\r\n", piece.size());
        chunked += size + piece + "\r\n";
    }
    chunked += "0\r\n\r\n";
    struct Case {
        const char* name;
        std::string reply;
        bool hasLength;
        int finalResult;
        std::string expected;
    } cases[] = {
        {"length", Head("Content-Length: 70001\r\n") + body, true, 0, body},
        {"chunked", Head("Transfer-Encoding: chunked\r\n") + chunked, false, 0, body},
        {"close-delimited", Head("Connection: close\r\n") + body, false, 0, body},
        {"length and chunked", Head("Content-Length: 5\r\nTransfer-Encoding: chunked\r\n") + chunked,
         false, 0, body},
        {"shorter than its length", Head("Content-Length: 80000\r\n") + body, true, -1, body},
        {"chunked, cut off", Head("Transfer-Encoding: chunked\r\n") + chunked.substr(0, 40000), false,
         -1, body},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        // The reply in pieces 5 ms apart: a read of a known length still returns it whole.
        ScriptServer server([&](int fd, const std::string& request, ScriptServer&) {
            EXPECT_EQ(request.rfind("GET /img.jpg?a=1 HTTP/1.1\r\n", 0), 0u);
            for (size_t at = 0; at < c.reply.size(); at += 10000) {
                if (!ScriptServer::Send(fd, c.reply.substr(at, 10000))) return;
                std::this_thread::sleep_for(5ms);
            }
        });
        OvHttpClient client("127.0.0.1", server.Port(), "img.jpg?a=1", "", "", 5);
        ASSERT_EQ(client.SendRequest(OV_HTTP_GET), 0);
        int status = 0;
        ASSERT_EQ(client.CheckResponse(status), 0);
        std::string length;
        EXPECT_EQ(client.GetHttpContent(HTTP_CONTENT_LENGTH, length) == 0, c.hasLength);
        int result = 1, first = 0;
        std::string got = ReadAll(client, c.hasLength ? 70001 : 8192, &result, &first);
        if (c.hasLength && c.finalResult == 0) {
            EXPECT_EQ(first, 70001);  // one read for the whole length
        }
        EXPECT_EQ(result < 0 ? -1 : result, c.finalResult);
        // What arrived is a prefix of the body (all of it when the read ended well).
        EXPECT_LE(got.size(), c.expected.size());
        EXPECT_TRUE(c.expected.compare(0, got.size(), got) == 0);
        if (c.finalResult == 0) {
            EXPECT_EQ(got.size(), c.expected.size());
        }
    }
}

TEST(OvHttpClient, TheTimeoutBoundsEachWaitNotTheWholeBody) {
    // A server that never answers: CheckResponse fails after the timeout.
    {
        ScriptServer server([](int fd, const std::string&, ScriptServer& s) { s.Hold(fd, 10s); });
        OvHttpClient client("127.0.0.1", server.Port(), "/", "", "", 1);
        auto start = Clock::now();
        ASSERT_EQ(client.SendRequest(OV_HTTP_GET), 0);
        int status = 0;
        EXPECT_NE(client.CheckResponse(status), 0);
        EXPECT_GE(SecondsSince(start), 0.9);
        EXPECT_LT(SecondsSince(start), 3.0);
    }
    // A body that stops coming: the read fails one timeout after the last byte.
    {
        ScriptServer server([](int fd, const std::string&, ScriptServer& s) {
            ScriptServer::Send(fd, Head("Content-Length: 1000\r\n") + "0123456789");
            s.Hold(fd, 10s);
        });
        OvHttpClient client("127.0.0.1", server.Port(), "/", "", "", 1);
        ASSERT_EQ(client.SendRequest(OV_HTTP_GET), 0);
        int status = 0;
        ASSERT_EQ(client.CheckResponse(status), 0);
        auto start = Clock::now();
        char buf[1000];
        EXPECT_LT(client.ReadData(buf, 1000), 0);
        EXPECT_GE(SecondsSince(start), 0.9);
        EXPECT_LT(SecondsSince(start), 3.0);
    }
    // A body that trickles for longer than the timeout, never pausing that long: read whole.
    {
        ScriptServer server([](int fd, const std::string&, ScriptServer&) {
            ScriptServer::Send(fd, Head("Content-Length: 8\r\n"));
            for (int i = 0; i < 8; ++i) {
                std::this_thread::sleep_for(250ms);
                ScriptServer::Send(fd, "x");
            }
        });
        OvHttpClient client("127.0.0.1", server.Port(), "/", "", "", 1);
        ASSERT_EQ(client.SendRequest(OV_HTTP_GET), 0);
        int status = 0;
        ASSERT_EQ(client.CheckResponse(status), 0);
        char buf[8];
        EXPECT_EQ(client.ReadData(buf, 8), 8);
    }
    // Nobody listening: fails at once.
    {
        int port = testsrv::FreePort();
        OvHttpClient client("127.0.0.1", port, "/", "", "", 5);
        auto start = Clock::now();
        int status = 0;
        EXPECT_TRUE(client.SendRequest(OV_HTTP_GET) != 0 || client.CheckResponse(status) != 0);
        EXPECT_LT(SecondsSince(start), 2.0);
    }
}

TEST(OvHttpClient, ASlowReaderHoldsBackTheServer) {
    // The server pushes an endless body as fast as the socket takes it; the
    // client reads 100 bytes at a time. What the server gets rid of is bounded
    // by the socket buffers and the client's queue, not by what it sends.
    std::atomic<long long> sent{0};
    ScriptServer server([&](int fd, const std::string&, ScriptServer& s) {
        ScriptServer::Send(fd, Head("Connection: close\r\n"));
        const std::string block(65536, 'z');
        auto end = Clock::now() + 1500ms;
        while (!s.Stopping() && Clock::now() < end) {
            ssize_t n = send(fd, block.data(), block.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
            if (n > 0) {
                sent += n;
            } else if (errno == EAGAIN || errno == EWOULDBLOCK) {
                std::this_thread::sleep_for(5ms);
            } else {
                break;
            }
        }
    });
    OvHttpClient client("127.0.0.1", server.Port(), "/", "", "", 5);
    ASSERT_EQ(client.SendRequest(OV_HTTP_GET), 0);
    int status = 0;
    ASSERT_EQ(client.CheckResponse(status), 0);
    char buf[100];
    long long read = 0;
    auto end = Clock::now() + 1s;
    while (Clock::now() < end) {
        int n = client.ReadData(buf, sizeof buf);
        ASSERT_GT(n, 0);
        read += n;
        std::this_thread::sleep_for(2ms);
    }
    EXPECT_GT(read, 0);
    EXPECT_LT(sent.load(), 32LL << 20) << "the client kept reading into memory";
}

std::string Part(const std::string& content, bool withLength) {
    return std::string("--frame\r\nContent-Type: image/jpeg\r\n") +
           (withLength ? "Content-Length: " + std::to_string(content.size()) + "\r\n" : "") + "\r\n" +
           content + "\r\n";
}

TEST(MultipartFetch, ReadsPartsAsTheyArrive) {
    const std::string a = testsrv::JpegLike(50000, 3), b = testsrv::JpegLike(30000, 4);
    ScriptServer server([&](int fd, const std::string&, ScriptServer& s) {
        ScriptServer::Send(fd, Head("Content-Type: multipart/x-mixed-replace; boundary=frame\r\n"
                                    "Transfer-Encoding: chunked\r\n"));
        std::string stream = Part(a, false) + Part(b, true);
        for (size_t at = 0; at < stream.size(); at += 7000) {
            std::string piece = stream.substr(at, 7000);
            char size[32];
            snprintf(size, sizeof size, "%zx\r\n", piece.size());
            if (!ScriptServer::Send(fd, size + piece + "\r\n")) return;
            std::this_thread::sleep_for(5ms);
        }
        s.Hold(fd, 10s);  // the stream goes on
    });
    MultipartFetch reader("127.0.0.1", server.Port(), "/mjpeg", "", "", 5);
    unsigned int length = 0;
    char info[16];
    ASSERT_EQ(reader.NextPartInfo(length, info, sizeof info), 0);
    ASSERT_EQ(length, a.size());
    EXPECT_STREQ(info, "Content-Type: i");  // cut to the buffer, NUL-terminated
    std::string got(length, '\0');
    ASSERT_EQ(reader.FetchContent(reinterpret_cast<unsigned char*>(&got[0]), 20000), 0);
    ASSERT_EQ(reader.FetchContent(reinterpret_cast<unsigned char*>(&got[20000]), length - 20000), 0);
    EXPECT_TRUE(got == a);
    EXPECT_NE(reader.FetchContent(reinterpret_cast<unsigned char*>(&got[0]), 1), 0);  // past the part
    ASSERT_EQ(reader.NextPartInfo(length, info, sizeof info), 0);
    ASSERT_EQ(length, b.size());
    got.assign(length, '\0');
    ASSERT_EQ(reader.FetchContent(reinterpret_cast<unsigned char*>(&got[0]), length), 0);
    EXPECT_TRUE(got == b);
    // Nothing more comes: the third part fails after the timeout.
}

TEST(MultipartFetch, Failures) {
    struct Case {
        const char* name;
        std::string reply;
        bool hold;  // keep the connection open afterwards
    } cases[] = {
        {"404", "HTTP/1.1 404 Not Found\r\nContent-Length: 0\r\n\r\n", false},
        {"stream ends inside the part", Head("Content-Type: multipart/x-mixed-replace;boundary=frame\r\n"
                                             "Connection: close\r\n") +
                                            Part("abcdef", true).substr(0, 60), false},
        {"stalls inside the part", Head("Content-Type: multipart/x-mixed-replace;boundary=frame\r\n"
                                        "Connection: close\r\n") +
                                       Part("abcdef", false).substr(0, 60), true},
        {"part above 64 MiB", Head("Content-Type: multipart/x-mixed-replace;boundary=frame\r\n"
                                   "Connection: close\r\n") +
                                  "--frame\r\nContent-Length: 67108865\r\n\r\nxx", true},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        ScriptServer server([&](int fd, const std::string&, ScriptServer& s) {
            ScriptServer::Send(fd, c.reply);
            if (c.hold) s.Hold(fd, 10s);
        });
        MultipartFetch reader("127.0.0.1", server.Port(), "/", "", "", 1);
        auto start = Clock::now();
        unsigned int length = 0;
        char info[100];
        EXPECT_NE(reader.NextPartInfo(length, info, sizeof info), 0);
        EXPECT_LT(SecondsSince(start), 3.0);
        unsigned char byte;
        EXPECT_NE(reader.FetchContent(&byte, 1), 0);
    }
}

}  // namespace
