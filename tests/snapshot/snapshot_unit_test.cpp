// SnapshotGet, SnapshotFileGet and SnapshotFileDelete against the fake camera
// layer and the fake HTTP transport (files: real ones under /tmp/).
#include <dirent.h>
#include <malloc.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include <gtest/gtest.h>

#include "fake/fake_host.h"
#include "fake/fake_http.h"
#include "static_api.h"

namespace {

using Calls = std::vector<std::string>;
using fake::HttpReply;
using fake::MultipartReply;
unsigned char* const kUntouched = reinterpret_cast<unsigned char*>(0x1);

class SnapshotGetTest : public ::testing::Test {
protected:
    void SetUp() override {
        api_ = newCameraAPI("cam", 80, "admin", "pw", "onvif", "m", "0");
        Reset();
    }
    void TearDown() override {
        Free();
        delete api_;
        EXPECT_TRUE(fake::LogTexts().empty());
    }
    static void Reset(int type = 1) {
        fake::Reset();
        fake::CameraHost("cam").snapshotPath = "/img/snap.jpg";
        fake::CameraHost("cam").snapshotType = type;
    }
    void Free() { SnapshotFree(buffer_ == kUntouched ? nullptr : buffer_); }
    int Get() {
        Free();
        buffer_ = kUntouched;
        size_ = 42;
        return SnapshotGet("cam", 80, "admin", "pw", *api_, "640x480", &buffer_, &size_);
    }
    template <class Exchange>
    static std::string Describe(const Exchange& e) {
        return e.host + " " + std::to_string(e.port) + " " + e.path + " " + e.username + " " + e.password + " " +
               std::to_string(e.timeout) + (e.destroyed ? "" : " LEAKED");
    }

    CameraAPI* api_ = nullptr;
    unsigned char* buffer_ = nullptr;
    int size_ = 0;
};

TEST_F(SnapshotGetTest, FailuresBeforeTheFetchTouchNeitherTransportNorOutputs) {
    EXPECT_EQ(SnapshotGet("cam", 80, "u", "p", *api_, "r", nullptr, &size_), -1);
    EXPECT_EQ(SnapshotGet("cam", 80, "u", "p", *api_, "r", &buffer_, nullptr), -1);
    EXPECT_TRUE(fake::CameraCalls().empty());
    struct Case {
        int setResoRc, pathRc, type;
        size_t cameraCalls;
    } cases[] = {{1, 0, 1, 1}, {0, -1, 1, 2}, {0, 0, 0, 2}, {0, 0, 3, 2}};
    for (const Case& c : cases) {
        SCOPED_TRACE(c.type);
        Reset(c.type);
        fake::CameraHost("cam").setResoRc = c.setResoRc;
        fake::CameraHost("cam").snapshotPathRc = c.pathRc;
        EXPECT_EQ(Get(), -1);
        EXPECT_EQ(buffer_, kUntouched);
        EXPECT_EQ(size_, 42);
        EXPECT_EQ(fake::CameraCallNames().size(), c.cameraCalls);
        EXPECT_TRUE(fake::HttpExchanges().empty() && fake::MultipartExchanges().empty());
    }
}

// With a Content-Length: one buffer of that size and one read; without: 128 KiB
// doubled only when full, never beyond 64 MiB (a small probe sees the end there).
TEST_F(SnapshotGetTest, HttpBodiesAreReadIntoBuffersOfTheRightSize) {
    struct Case {
        HttpReply reply;
        long long size;
        Calls reads;  // after SendRequest, CheckResponse, GetHttpContent; empty: not checked
        size_t capacity;
    } cases[] = {
        {HttpReply().Length("2048abc").Generated(2048), 2048, {"ReadData 2048"}, 2048},
        {HttpReply().Generated(0), 0, {"ReadData 131072"}, 131072},  // an empty image still has its buffer
        {HttpReply().Generated(131071), 131071, {"ReadData 131072", "ReadData 1"}, 131072},
        {HttpReply().Generated(131072), 131072, {"ReadData 131072", "ReadData 131072"}, 262144},
        {HttpReply().Generated(300000), 300000,
         {"ReadData 131072", "ReadData 131072", "ReadData 262144", "ReadData 224288"}, 524288},
        {HttpReply().Generated(67108864), 67108864, {}, 67108864},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.size);
        Reset();
        fake::CameraHost("cam").snapshotPort = 8081;  // the camera layer replaces the port
        fake::SetHttpReply(c.reply);
        ASSERT_EQ(Get(), 0);
        EXPECT_EQ(size_, c.size);
        auto ex = fake::HttpExchanges().at(0);
        EXPECT_EQ(Describe(ex), "cam 8081 /img/snap.jpg admin pw 30");
        EXPECT_EQ(Calls(ex.calls.begin(), ex.calls.begin() + 3),
                  (Calls{"SendRequest 0", "CheckResponse", "GetHttpContent 1"}));
        EXPECT_EQ(c.reads.empty() ? Calls{ex.calls.back()} : Calls(ex.calls.begin() + 3, ex.calls.end()),
                  c.reads.empty() ? Calls{"ReadData 16"} : c.reads);
        EXPECT_GE(malloc_usable_size(buffer_), c.capacity);
        EXPECT_LT(malloc_usable_size(buffer_), c.capacity + 8192);
        EXPECT_TRUE(c.size == 0 || buffer_[c.size - 1] == fake::PatternByte(c.size - 1));
    }
    EXPECT_EQ(fake::CameraCallNames(), (Calls{"SetReso 640x480", "GetSnapshotPath"}));
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
        Reset();
        fake::SetHttpReply(c.reply);
        EXPECT_EQ(Get(), -1);
        EXPECT_EQ(buffer_, nullptr);
        EXPECT_EQ(fake::HttpExchanges().at(0).calls.size(), c.calls);
        EXPECT_TRUE(fake::HttpExchanges().at(0).destroyed);
    }
}

TEST_F(SnapshotGetTest, MultipartReturnsTheFirstPartOnly) {
    struct Case {
        MultipartReply reply;
        int rc;
        Calls calls;
    } cases[] = {
        {MultipartReply().Length(5).Content("abcde"), 0, {"NextPartInfo 100", "FetchContent 5"}},
        {MultipartReply().NextRc(-1), -1, {"NextPartInfo 100"}},
        {MultipartReply().Length(4).FetchRc(-1), -1, {"NextPartInfo 100", "FetchContent 4"}},
        {MultipartReply().Length(67108865), -1, {"NextPartInfo 100"}},  // beyond 64 MiB: not even allocated
    };
    for (const Case& c : cases) {
        Reset(2);
        fake::SetMultipartReply(c.reply);
        EXPECT_EQ(Get(), c.rc);
        EXPECT_EQ(c.rc ? "" : std::string(reinterpret_cast<char*>(buffer_), size_), c.rc ? "" : "abcde");
        EXPECT_EQ(buffer_ == nullptr, c.rc != 0);
        EXPECT_EQ(Describe(fake::MultipartExchanges().at(0)), "cam 80 /img/snap.jpg admin pw 10");
        EXPECT_EQ(fake::MultipartExchanges().at(0).calls, c.calls);
    }
}

class SnapshotFileTest : public ::testing::Test {
protected:
    void SetUp() override {
        fake::Reset();
        unlink(path_.c_str());
        camera_.SetSettings({id_, "cam", 8000, "admin", "pw", "onvif", "M1", "2", "/user/path.jpg", "1280x720"});
        Serve("image one");
    }
    void TearDown() override {
        unlink(path_.c_str());
        EXPECT_EQ(fake::ApisOutstanding(), 0);
        EXPECT_TRUE(fake::LogTexts().empty());
        const std::string prefix = "ov_snapshot_id_" + std::to_string(id_) + ".jpg.";  // no temp file left
        DIR* dir = opendir("/tmp");
        while (dirent* e = dir ? readdir(dir) : nullptr) EXPECT_NE(std::string(e->d_name).rfind(prefix, 0), 0u);
        if (dir) closedir(dir);
    }
    static void Serve(const std::string& image) {
        fake::SetHttpReply(fake::HttpReply().Length(std::to_string(image.size())).Body(image));
    }
    mode_t Mode() {
        struct stat st {};
        lstat(path_.c_str(), &st);
        return st.st_mode;
    }

    const int id_ = 700000000 + getpid() % 1000000;  // a file of this process only
    const std::string path_ = "/tmp/ov_snapshot_id_" + std::to_string(id_) + ".jpg";
    Camera camera_;
};

TEST_F(SnapshotFileTest, WritesTheImageWithWhicheverControlObjectTheFactoriesGive) {
    EXPECT_EQ(SnapshotFileGet(nullptr), -1);
    EXPECT_TRUE(fake::CameraCalls().empty());
    const std::string vendor = "newCameraAPI cam 8000 admin pw onvif M1 2";
    const std::string user = "newUserDefinedAPI cam 8000 admin pw /user/path.jpg 1";
    for (bool vendorApi : {true, false}) {
        fake::Reset();
        fake::CameraHost("cam").apiNull = !vendorApi;
        fake::CameraHost("cam").userApiNull = vendorApi;
        Serve(vendorApi ? "vendor image" : "user image");
        mode_t old = umask(027);
        ASSERT_EQ(SnapshotFileGet(&camera_), 0);
        umask(old);
        EXPECT_EQ(FileContent(path_), vendorApi ? "vendor image" : "user image");
        Calls calls = {vendor, user, "SetReso 1280x720", "GetSnapshotPath", "releaseCameraAPI"};
        if (vendorApi) calls.erase(calls.begin() + 1);
        EXPECT_EQ(fake::CameraCallNames(), calls);
        EXPECT_EQ(Mode(), S_IFREG | 0640u);  // what fopen would give under that umask
    }
    fake::SetHttpReply({});  // an empty image without Content-Length: an empty file
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    EXPECT_EQ(FileContent(path_), "");
}

// Failures leave the old file as it was and no temp file (TearDown); a planted
// symlink is replaced, not followed; delete removes the file, missing or not.
TEST_F(SnapshotFileTest, TheFileIsReplacedWholeOrNotAtAllAndDeleted) {
    std::ofstream(path_) << "old image";
    fake::CameraHost("cam").apiNull = true;  // and no user-defined object either
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    EXPECT_TRUE(fake::HttpExchanges().empty());
    fake::CameraHost("cam").apiNull = false;
    fake::SetHttpReply(fake::HttpReply().Code(404));
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    fake::SetHttpReply(fake::HttpReply().Length("100").Body("short"));
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    // A transport that gives up midway (its deadline passed) after some bytes.
    fake::SetHttpReply(fake::HttpReply().Length("100").Generated(100).FailAfter(50));
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    EXPECT_EQ(FileContent(path_), "old image");
    unlink(path_.c_str());
    ASSERT_EQ(mkdir(path_.c_str(), 0700), 0);  // a directory at the path: the rename fails
    Serve("image one");
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    rmdir(path_.c_str());

    const std::string victim = "/tmp/ptz_snapshot_victim_" + std::to_string(getpid());
    std::ofstream(victim) << "precious";
    ASSERT_EQ(symlink(victim.c_str(), path_.c_str()), 0);
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    EXPECT_EQ(Mode() & S_IFMT, S_IFREG);
    EXPECT_EQ(FileContent(path_), "image one");
    EXPECT_EQ(FileContent(victim), "precious");
    unlink(victim.c_str());
    EXPECT_EQ(SnapshotFileDelete(id_), 0);
    EXPECT_EQ(Mode(), 0u);
    EXPECT_EQ(SnapshotFileDelete(id_), 0);  // a missing file is fine
}

TEST_F(SnapshotFileTest, AConcurrentReaderSeesOnlyWholeImages) {
    const std::string a(300000, 'a'), b(70000, 'b');
    Serve(a);
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    std::atomic<bool> stop{false};
    std::atomic<int> reads{0}, torn{0};
    std::thread reader([&] {
        for (; !stop; ++reads) {
            std::string got = FileContent(path_);
            torn += got != a && got != b;
        }
    });
    for (int i = 0; i < 200; ++i) {
        Serve(i % 2 ? a : b);
        ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    }
    fake::WaitFor([&] { return reads > 50; }, std::chrono::seconds(10));
    stop = true;
    reader.join();
    EXPECT_EQ(torn, 0);
}

}  // namespace
