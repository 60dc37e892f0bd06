// SnapshotGet against the fake camera layer and the fake HTTP transport.
#include <malloc.h>

#include <gtest/gtest.h>

#include "fake/fake_host.h"
#include "fake/fake_http.h"
#include "snapshot/snapshot.h"

namespace {

using Calls = std::vector<std::string>;
using fake::HttpReply;
using fake::MultipartReply;
unsigned char* const kSentinel = reinterpret_cast<unsigned char*>(0x1);

class SnapshotGetTest : public ::testing::Test {
protected:
    void SetUp() override {
        fake::Reset();
        api_ = newCameraAPI("cam", 80, "admin", "pw", "onvif", "m", "0");
        fake::Reset();  // forget the factory call
        fake::CameraHost("cam").snapshotPath = "/img/snap.jpg";
    }
    void TearDown() override {
        SnapshotFree(buffer_ == kSentinel ? nullptr : buffer_);
        delete api_;
        EXPECT_TRUE(fake::LogTexts().empty());
    }
    int Get() {
        SnapshotFree(buffer_ == kSentinel ? nullptr : buffer_);
        buffer_ = kSentinel;
        return SnapshotGet("cam", 80, "admin", "pw", *api_, "640x480", &buffer_, &size_);
    }
    // The transport calls after SendRequest, CheckResponse and GetHttpContent.
    static Calls Reads() {
        Calls c = fake::HttpExchanges().at(0).calls;
        return Calls(c.begin() + std::min<size_t>(3, c.size()), c.end());
    }

    CameraAPI* api_ = nullptr;
    unsigned char* buffer_ = nullptr;
    int size_ = -7;
};

TEST_F(SnapshotGetTest, FailuresBeforeTheFetchTouchNeitherTransportNorOutputs) {
    int size = 42;
    EXPECT_EQ(SnapshotGet("cam", 80, "u", "p", *api_, "r", nullptr, &size), -1);
    EXPECT_EQ(SnapshotGet("cam", 80, "u", "p", *api_, "r", &buffer_, nullptr), -1);
    EXPECT_TRUE(fake::CameraCalls().empty());
    struct Case {
        int setResoRc, pathRc, type;
        size_t cameraCalls;
    } cases[] = {{1, 0, 1, 1}, {0, -1, 1, 2}, {0, 0, 0, 2}, {0, 0, 3, 2}};
    for (const Case& c : cases) {
        SCOPED_TRACE(c.type);
        fake::Reset();
        fake::CameraHost("cam").setResoRc = c.setResoRc;
        fake::CameraHost("cam").snapshotPathRc = c.pathRc;
        fake::CameraHost("cam").snapshotType = c.type;
        size_ = 42;
        EXPECT_EQ(Get(), -1);
        EXPECT_EQ(buffer_, kSentinel);
        EXPECT_EQ(size_, 42);
        EXPECT_EQ(fake::CameraCallNames().size(), c.cameraCalls);
        EXPECT_TRUE(fake::HttpExchanges().empty() && fake::MultipartExchanges().empty());
    }
}

TEST_F(SnapshotGetTest, HttpWithContentLengthReadsTheBodyInOneCall) {
    fake::CameraHost("cam").snapshotPort = 8081;  // the camera layer replaces the port
    fake::SetHttpReply(HttpReply().Length("2048abc").Generated(2048));
    ASSERT_EQ(Get(), 0);
    EXPECT_EQ(size_, 2048);
    EXPECT_EQ(buffer_[2047], fake::PatternByte(2047));
    EXPECT_LT(malloc_usable_size(buffer_), 4096u);  // sized by the length, not 128 KiB
    EXPECT_EQ(fake::CameraCallNames(), (Calls{"SetReso 640x480", "GetSnapshotPath"}));
    auto ex = fake::HttpExchanges().at(0);
    EXPECT_EQ(ex.host + " " + std::to_string(ex.port) + " " + ex.path + " " + ex.username + " " +
                  ex.password + " " + std::to_string(ex.timeout),
              "cam 8081 /img/snap.jpg admin pw 30");
    EXPECT_EQ(ex.calls, (Calls{"SendRequest 0", "CheckResponse", "GetHttpContent 1", "ReadData 2048"}));
    EXPECT_TRUE(ex.destroyed);
}

TEST_F(SnapshotGetTest, HttpFailuresLeaveNoBuffer) {
    struct Case {
        const char* name;
        HttpReply reply;
        size_t calls;  // transport calls made
    } cases[] = {
        {"send fails", HttpReply().SendRc(-1), 1},
        {"no response", HttpReply().CheckRc(-1), 2},
        {"302", HttpReply().Code(302).Length("5").Body("moved"), 2},
        {"401", HttpReply().Code(401).Length("5").Body("nope!"), 2},
        {"404", HttpReply().Code(404), 2},
        {"length 0", HttpReply().Length("0"), 3},
        {"length without digits", HttpReply().Length("abc").Body("x"), 3},
        {"negative length", HttpReply().Length("-5").Body("x"), 3},
        {"length beyond int", HttpReply().Length("4294967296").Body("x"), 3},
        {"length beyond 64 MiB", HttpReply().Length("67108865").Body("x"), 3},
        {"body shorter than length", HttpReply().Length("20").Body("only ten b"), 4},
        {"read error with length", HttpReply().Length("10").Body("0123456789").FailAfter(0), 4},
        {"read error without length", HttpReply().Generated(400000).FailAfter(200000), 5},
        // One read per capacity from 128 KiB to 64 MiB, then the probe that finds one more byte.
        {"64 MiB + 1 without length", HttpReply().Generated(67108865), 3 + 10 + 1},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        fake::Reset();
        fake::SetHttpReply(c.reply);
        EXPECT_EQ(Get(), -1);
        EXPECT_EQ(buffer_, nullptr);
        EXPECT_EQ(fake::HttpExchanges().at(0).calls.size(), c.calls);
        EXPECT_TRUE(fake::HttpExchanges().at(0).destroyed);
    }
}

TEST_F(SnapshotGetTest, WithoutLengthTheBufferStartsAt128KiBAndDoublesOnlyWhenFull) {
    struct Case {
        long long body;
        Calls reads;
        size_t capacity;
    } cases[] = {
        {0, {"ReadData 131072"}, 131072},  // an empty image still comes with its buffer
        {131071, {"ReadData 131072", "ReadData 1"}, 131072},
        {131072, {"ReadData 131072", "ReadData 131072"}, 262144},  // doubled before the end is seen
        {300000, {"ReadData 131072", "ReadData 131072", "ReadData 262144", "ReadData 224288"}, 524288},
        // Full at the 64 MiB bound: not doubled, a small probe sees the end.
        {67108864, {}, 67108864},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.body);
        fake::Reset();
        fake::SetHttpReply(HttpReply().Generated(c.body));
        ASSERT_EQ(Get(), 0);
        EXPECT_EQ(size_, c.body);
        if (!c.reads.empty()) {
            EXPECT_EQ(Reads(), c.reads);
        }
        EXPECT_GE(malloc_usable_size(buffer_), c.capacity);
        EXPECT_LT(malloc_usable_size(buffer_), c.capacity + 8192);
        if (c.body > 0) {
            EXPECT_EQ(buffer_[c.body - 1], fake::PatternByte(c.body - 1));
        }
    }
    EXPECT_EQ(Reads().back(), "ReadData 16");
}

TEST_F(SnapshotGetTest, MultipartReturnsTheFirstPartOnly) {
    fake::CameraHost("cam").snapshotType = 2;
    fake::SetMultipartReply(MultipartReply().Length(5).Content("abcde"));
    ASSERT_EQ(Get(), 0);
    EXPECT_EQ(std::string(reinterpret_cast<char*>(buffer_), size_), "abcde");
    auto ex = fake::MultipartExchanges().at(0);
    EXPECT_EQ(ex.host + " " + std::to_string(ex.port) + " " + ex.path + " " + ex.username + " " +
                  ex.password + " " + std::to_string(ex.timeout),
              "cam 80 /img/snap.jpg admin pw 10");
    EXPECT_EQ(ex.calls, (Calls{"NextPartInfo 100", "FetchContent 5"}));
    EXPECT_TRUE(ex.destroyed);

    struct Case {
        MultipartReply reply;
        size_t calls;
    } failures[] = {{MultipartReply().NextRc(-1), 1},
                    {MultipartReply().Length(4).FetchRc(-1), 2},
                    {MultipartReply().Length(67108865), 1}};  // beyond 64 MiB: not even allocated
    for (const Case& c : failures) {
        fake::Reset();
        fake::CameraHost("cam").snapshotType = 2;
        fake::SetMultipartReply(c.reply);
        EXPECT_EQ(Get(), -1);
        EXPECT_EQ(buffer_, nullptr);
        EXPECT_EQ(fake::MultipartExchanges().at(0).calls.size(), c.calls);
        EXPECT_TRUE(fake::MultipartExchanges().at(0).destroyed);
    }
}

}  // namespace
