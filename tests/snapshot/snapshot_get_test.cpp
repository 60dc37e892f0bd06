// SnapshotGet against the fake camera layer and the fake HTTP transport.
#include <malloc.h>

#include <gtest/gtest.h>

#include "fake/fake_host.h"
#include "fake/fake_http.h"
#include "snapshot/snapshot.h"

namespace {

using Calls = std::vector<std::string>;

class SnapshotGetTest : public ::testing::Test {
protected:
    void SetUp() override {
        fake::Reset();
        fake::CameraHost("cam").snapshotPath = "/img/snap.jpg";
        api_ = newCameraAPI("cam", 80, "admin", "pw", "onvif", "m", "0");
        ASSERT_NE(api_, nullptr);
    }
    void TearDown() override {
        SnapshotFree(buffer_);
        releaseCameraAPI(api_);
    }
    int Get() { return SnapshotGet("cam", 80, "admin", "pw", *api_, "640x480", &buffer_, &size_); }
    std::string Got() const { return std::string(reinterpret_cast<char*>(buffer_), size_); }

    CameraAPI* api_ = nullptr;
    unsigned char* buffer_ = nullptr;
    int size_ = -7;
};

unsigned char* const kSentinel = reinterpret_cast<unsigned char*>(0x1);

TEST_F(SnapshotGetTest, NullOutputsFailBeforeAnyCall) {
    int size = 0;
    unsigned char* buffer = nullptr;
    fake::Reset();  // drop the factory call of SetUp from the records
    EXPECT_EQ(SnapshotGet("cam", 80, "u", "p", *api_, "r", nullptr, &size), -1);
    EXPECT_EQ(SnapshotGet("cam", 80, "u", "p", *api_, "r", &buffer, nullptr), -1);
    EXPECT_TRUE(fake::CameraCalls().empty());
    EXPECT_TRUE(fake::HttpExchanges().empty());
}

TEST_F(SnapshotGetTest, RefusalsBeforeTheFetchLeaveOutputsAsTheCallerSetThem) {
    struct Case {
        const char* name;
        int setResoRc, pathRc, type;
        Calls cameraCalls;
    } cases[] = {
        {"reso refused", 1, 0, 1, {"SetReso 640x480"}},
        {"path refused", 0, -1, 1, {"SetReso 640x480", "GetSnapshotPath"}},
        {"type 0", 0, 0, 0, {"SetReso 640x480", "GetSnapshotPath"}},
        {"type 3", 0, 0, 3, {"SetReso 640x480", "GetSnapshotPath"}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        fake::Reset();
        auto& host = fake::CameraHost("cam");
        host.setResoRc = c.setResoRc;
        host.snapshotPathRc = c.pathRc;
        host.snapshotType = c.type;
        unsigned char* buffer = kSentinel;
        int size = 42;
        EXPECT_EQ(SnapshotGet("cam", 80, "u", "p", *api_, "640x480", &buffer, &size), -1);
        EXPECT_EQ(buffer, kSentinel);
        EXPECT_EQ(size, 42);
        EXPECT_EQ(fake::CameraCallNames(), c.cameraCalls);
        EXPECT_TRUE(fake::HttpExchanges().empty());
        EXPECT_TRUE(fake::MultipartExchanges().empty());
    }
}

TEST_F(SnapshotGetTest, HttpWithContentLengthReadsTheBodyInOneCall) {
    fake::CameraHost("cam").snapshotPort = 8081;  // the camera layer replaces the port
    fake::SetHttpReply(fake::HttpReply().Length("11").Body("hello image"));
    ASSERT_EQ(Get(), 0);
    EXPECT_EQ(Got(), "hello image");
    auto ex = fake::HttpExchanges();
    ASSERT_EQ(ex.size(), 1u);
    EXPECT_EQ(ex[0].host, "cam");
    EXPECT_EQ(ex[0].port, 8081);
    EXPECT_EQ(ex[0].path, "/img/snap.jpg");
    EXPECT_EQ(ex[0].username, "admin");
    EXPECT_EQ(ex[0].password, "pw");
    EXPECT_EQ(ex[0].timeout, 30);
    EXPECT_EQ(ex[0].calls, (Calls{"SendRequest 0", "CheckResponse", "GetHttpContent 1", "ReadData 11"}));
    EXPECT_TRUE(ex[0].destroyed);
    EXPECT_LT(malloc_usable_size(buffer_), 64u);  // sized by the length, not the 128 KiB default
}

TEST_F(SnapshotGetTest, HttpFailuresFreeEverything) {
    struct Case {
        const char* name;
        fake::HttpReply reply;
        size_t calls;  // transport calls made
    } cases[] = {
        {"send fails", fake::HttpReply().SendRc(-1), 1},
        {"no response", fake::HttpReply().CheckRc(-1), 2},
        {"302", fake::HttpReply().Code(302).Length("5").Body("moved"), 2},
        {"401", fake::HttpReply().Code(401).Length("5").Body("nope!"), 2},
        {"404", fake::HttpReply().Code(404), 2},
        {"length 0", fake::HttpReply().Length("0"), 3},
        {"length without digits", fake::HttpReply().Length("abc").Body("x"), 3},
        {"negative length", fake::HttpReply().Length("-5").Body("x"), 3},
        {"length beyond int", fake::HttpReply().Length("4294967296").Body("x"), 3},
        {"length beyond 64 MiB", fake::HttpReply().Length("67108865").Body("x"), 3},
        {"body shorter than length", fake::HttpReply().Length("20").Body("only ten b"), 4},
        {"empty body with length", fake::HttpReply().Length("20"), 4},
        {"read error with length", fake::HttpReply().Length("10").Body("0123456789").FailAfter(0), 4},
        {"read error without length", fake::HttpReply().Generated(400000).FailAfter(200000), 5},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        fake::Reset();
        fake::SetHttpReply(c.reply);
        buffer_ = kSentinel;
        EXPECT_EQ(Get(), -1);
        EXPECT_EQ(buffer_, nullptr);
        auto ex = fake::HttpExchanges();
        ASSERT_EQ(ex.size(), 1u);
        EXPECT_EQ(ex[0].calls.size(), c.calls);
        EXPECT_TRUE(ex[0].destroyed);
    }
}

TEST_F(SnapshotGetTest, ContentLengthIsParsedLikeStrtol) {
    for (const char* text : {"2048abc", "  +2048", "2048"}) {
        SCOPED_TRACE(text);
        fake::Reset();
        fake::SetHttpReply(fake::HttpReply().Length(text).Generated(2048));
        ASSERT_EQ(Get(), 0);
        EXPECT_EQ(size_, 2048);
        EXPECT_EQ(fake::HttpExchanges()[0].calls.back(), "ReadData 2048");
        SnapshotFree(buffer_);
        buffer_ = nullptr;
    }
}

TEST_F(SnapshotGetTest, WithoutLengthTheBufferStartsAt128KiBAndDoublesWhenFull) {
    struct Case {
        long long body;
        Calls reads;
        size_t capacity;
    } cases[] = {
        {0, {"ReadData 131072"}, 131072},
        {1000, {"ReadData 131072", "ReadData 130072"}, 131072},
        {131071, {"ReadData 131072", "ReadData 1"}, 131072},
        // Exactly full: doubled before the read that sees the end.
        {131072, {"ReadData 131072", "ReadData 131072"}, 262144},
        {300000, {"ReadData 131072", "ReadData 131072", "ReadData 262144", "ReadData 224288"}, 524288},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.body);
        fake::Reset();
        fake::SetHttpReply(fake::HttpReply().Generated(c.body));
        buffer_ = nullptr;
        ASSERT_EQ(Get(), 0);
        ASSERT_NE(buffer_, nullptr);  // also for an empty body: the caller frees it
        EXPECT_EQ(size_, c.body);
        Calls reads = fake::HttpExchanges()[0].calls;
        reads.erase(reads.begin(), reads.begin() + 3);
        EXPECT_EQ(reads, c.reads);
        EXPECT_GE(malloc_usable_size(buffer_), c.capacity);
        EXPECT_LT(malloc_usable_size(buffer_), c.capacity + 4096);
        for (long long i = 0; i < c.body; ++i) {
            if (buffer_[i] != fake::PatternByte(i)) {
                ADD_FAILURE() << "byte " << i;
                break;
            }
        }
        SnapshotFree(buffer_);
        buffer_ = nullptr;
    }
}

TEST_F(SnapshotGetTest, NoBufferGrowsBeyond64MiB) {
    const long long kMax = 67108864;
    // Exactly the bound is accepted: full at the bound, a small probe sees the end.
    fake::SetHttpReply(fake::HttpReply().Generated(kMax));
    ASSERT_EQ(Get(), 0);
    EXPECT_EQ(size_, kMax);
    Calls calls = fake::HttpExchanges()[0].calls;
    EXPECT_EQ(calls.back(), "ReadData 16");
    EXPECT_LT(malloc_usable_size(buffer_), static_cast<size_t>(kMax) + 8192);
    EXPECT_EQ(buffer_[kMax - 1], fake::PatternByte(kMax - 1));
    SnapshotFree(buffer_);
    buffer_ = nullptr;

    // One byte more, without and with a Content-Length.
    fake::Reset();
    fake::SetHttpReply(fake::HttpReply().Generated(kMax + 1));
    EXPECT_EQ(Get(), -1);
    EXPECT_EQ(buffer_, nullptr);
    EXPECT_EQ(fake::HttpExchanges()[0].calls.back(), "ReadData 16");

    fake::Reset();
    fake::SetHttpReply(fake::HttpReply().Length(std::to_string(kMax)).Generated(kMax));
    ASSERT_EQ(Get(), 0);
    EXPECT_EQ(size_, kMax);
}

TEST_F(SnapshotGetTest, MultipartReturnsTheFirstPartOnly) {
    fake::CameraHost("cam").snapshotType = 2;
    fake::CameraHost("cam").snapshotPath = "/mjpeg?x=1";
    fake::SetMultipartReply(fake::MultipartReply().Length(5).Content("abcde"));
    ASSERT_EQ(Get(), 0);
    EXPECT_EQ(Got(), "abcde");
    EXPECT_TRUE(fake::HttpExchanges().empty());
    auto ex = fake::MultipartExchanges();
    ASSERT_EQ(ex.size(), 1u);
    EXPECT_EQ(ex[0].host, "cam");
    EXPECT_EQ(ex[0].port, 80);
    EXPECT_EQ(ex[0].path, "/mjpeg?x=1");
    EXPECT_EQ(ex[0].username, "admin");
    EXPECT_EQ(ex[0].password, "pw");
    EXPECT_EQ(ex[0].timeout, 10);
    EXPECT_EQ(ex[0].calls, (Calls{"NextPartInfo 100", "FetchContent 5"}));
    EXPECT_TRUE(ex[0].destroyed);
}

TEST_F(SnapshotGetTest, MultipartFailures) {
    struct Case {
        const char* name;
        fake::MultipartReply reply;
        Calls calls;
    } cases[] = {
        {"no part", fake::MultipartReply().NextRc(-1), {"NextPartInfo 100"}},
        {"fetch fails", fake::MultipartReply().Length(4).FetchRc(-1), {"NextPartInfo 100", "FetchContent 4"}},
        {"part beyond 64 MiB", fake::MultipartReply().Length(67108865), {"NextPartInfo 100"}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        fake::Reset();
        fake::CameraHost("cam").snapshotType = 2;
        fake::SetMultipartReply(c.reply);
        buffer_ = kSentinel;
        EXPECT_EQ(Get(), -1);
        EXPECT_EQ(buffer_, nullptr);
        auto ex = fake::MultipartExchanges();
        ASSERT_EQ(ex.size(), 1u);
        EXPECT_EQ(ex[0].calls, c.calls);
        EXPECT_TRUE(ex[0].destroyed);
    }
}

TEST_F(SnapshotGetTest, LogsNothing) {
    fake::SetHttpReply(fake::HttpReply().Code(404));
    EXPECT_EQ(Get(), -1);
    fake::SetHttpReply(fake::HttpReply().Length("3").Body("abc"));
    EXPECT_EQ(Get(), 0);
    EXPECT_TRUE(fake::LogTexts().empty());
}

TEST(SnapshotFree, AcceptsNull) { SnapshotFree(nullptr); }

}  // namespace
