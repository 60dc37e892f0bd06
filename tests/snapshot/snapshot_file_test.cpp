// SnapshotFileGet / SnapshotFileDelete against the fake camera layer and the
// fake HTTP transport, on real files under /tmp/.
#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <sstream>
#include <thread>

#include <gtest/gtest.h>

#include "fake/fake_host.h"
#include "fake/fake_http.h"
#include "snapshot/snapshot.h"

namespace {

using Calls = std::vector<std::string>;

// Camera ids of this process, so parallel test runs use different files.
int TestCamId(int n) { return 700000000 + (getpid() % 1000000) * 10 + n; }

std::string PathOf(int id) { return "/tmp/ov_snapshot_id_" + std::to_string(id) + ".jpg"; }

bool Exists(const std::string& path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

void WriteFile(const std::string& path, const std::string& text) {
    std::ofstream(path, std::ios::binary) << text;
}

// Files in /tmp whose names start with `prefix` (temp files left behind).
std::vector<std::string> TmpFilesStartingWith(const std::string& prefix) {
    std::vector<std::string> names;
    DIR* dir = opendir("/tmp");
    while (dirent* e = dir ? readdir(dir) : nullptr) {
        std::string name = e->d_name;
        if (name.compare(0, prefix.size(), prefix) == 0) names.push_back(name);
    }
    if (dir) closedir(dir);
    return names;
}

class SnapshotFileTest : public ::testing::Test {
protected:
    void SetUp() override {
        fake::Reset();
        id_ = TestCamId(0);
        path_ = PathOf(id_);
        Cleanup();
        CameraSettings c;
        c.id = id_;
        c.host = "cam";
        c.port = 8000;
        c.username = "admin";
        c.password = "pw";
        c.vendor = "onvif";
        c.model = "M1";
        c.channel = "2";
        c.path = "/user/path.jpg";
        c.liveReso = "1280x720";
        camera_.SetSettings(c);
        Serve("image one");
    }
    void TearDown() override {
        Cleanup();
        EXPECT_EQ(fake::ApisOutstanding(), 0);
        EXPECT_TRUE(TmpFilesStartingWith("ov_snapshot_id_" + std::to_string(id_) + ".jpg.").empty());
        EXPECT_TRUE(fake::LogTexts().empty());
    }
    void Cleanup() {
        unlink(path_.c_str());
        rmdir(path_.c_str());
    }
    static void Serve(const std::string& image) {
        fake::SetHttpReply(fake::HttpReply().Length(std::to_string(image.size())).Body(image));
    }

    int id_ = 0;
    std::string path_;
    Camera camera_;
};

TEST_F(SnapshotFileTest, NullCamera) {
    EXPECT_EQ(SnapshotFileGet(nullptr), -1);
    EXPECT_TRUE(fake::CameraCalls().empty());
}

TEST_F(SnapshotFileTest, WritesTheImageWithTheVendorControlObject) {
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    EXPECT_EQ(ReadFile(path_), "image one");
    EXPECT_EQ(fake::CameraCallNames(),
              (Calls{"newCameraAPI cam 8000 admin pw onvif M1 2", "SetReso 1280x720",
                     "GetSnapshotPath", "releaseCameraAPI"}));
    auto ex = fake::HttpExchanges();
    ASSERT_EQ(ex.size(), 1u);
    EXPECT_EQ(ex[0].port, 8000);
    EXPECT_EQ(ex[0].path, "/snap.jpg");
}

TEST_F(SnapshotFileTest, FallsBackToTheUserDefinedControlObject) {
    fake::CameraHost("cam").apiNull = true;
    fake::CameraHost("cam").userApiNull = false;
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    EXPECT_EQ(ReadFile(path_), "image one");
    EXPECT_EQ(fake::CameraCallNames(),
              (Calls{"newCameraAPI cam 8000 admin pw onvif M1 2",
                     "newUserDefinedAPI cam 8000 admin pw /user/path.jpg 1", "SetReso 1280x720",
                     "GetSnapshotPath", "releaseCameraAPI"}));
}

TEST_F(SnapshotFileTest, FailuresLeaveTheOldFileAsItWas) {
    WriteFile(path_, "old image");
    // No control object at all.
    fake::CameraHost("cam").apiNull = true;
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    EXPECT_TRUE(fake::HttpExchanges().empty());
    EXPECT_EQ(ReadFile(path_), "old image");
    // The fetch fails, also after part of the body arrived.
    fake::CameraHost("cam").apiNull = false;
    fake::SetHttpReply(fake::HttpReply().Code(404));
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    fake::SetHttpReply(fake::HttpReply().Length("100").Body("short"));
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    EXPECT_EQ(ReadFile(path_), "old image");
}

TEST_F(SnapshotFileTest, EachWriteReplacesTheWholeFile) {
    Serve("a long first image");
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    Serve("second");
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    EXPECT_EQ(ReadFile(path_), "second");
    Serve("");  // an empty image without Content-Length: an empty file
    fake::SetHttpReply(fake::HttpReply());
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    ASSERT_TRUE(Exists(path_));
    EXPECT_EQ(ReadFile(path_), "");
}

TEST_F(SnapshotFileTest, FileModeIsWhatFopenWouldGive) {
    mode_t old = umask(027);
    int rc = SnapshotFileGet(&camera_);
    umask(old);
    ASSERT_EQ(rc, 0);
    struct stat st;
    ASSERT_EQ(stat(path_.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0640u);
}

TEST_F(SnapshotFileTest, APlantedSymlinkIsReplacedNotFollowed) {
    std::string victim = "/tmp/ptz_snapshot_victim_" + std::to_string(getpid());
    WriteFile(victim, "precious");
    ASSERT_EQ(symlink(victim.c_str(), path_.c_str()), 0);
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    struct stat st;
    ASSERT_EQ(lstat(path_.c_str(), &st), 0);
    EXPECT_TRUE(S_ISREG(st.st_mode));
    EXPECT_EQ(ReadFile(path_), "image one");
    EXPECT_EQ(ReadFile(victim), "precious");
    unlink(victim.c_str());
}

TEST_F(SnapshotFileTest, AFailedReplaceLeavesNoTempFile) {
    // A directory at the path: the rename cannot replace it.
    ASSERT_EQ(mkdir(path_.c_str(), 0700), 0);
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    struct stat st;
    ASSERT_EQ(stat(path_.c_str(), &st), 0);
    EXPECT_TRUE(S_ISDIR(st.st_mode));
}

TEST_F(SnapshotFileTest, AConcurrentReaderSeesOnlyWholeImages) {
    const std::string a(300000, 'a'), b(70000, 'b');
    Serve(a);
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    std::atomic<bool> stop{false};
    std::atomic<int> reads{0}, torn{0};
    std::thread reader([&] {
        while (!stop) {
            std::string got = ReadFile(path_);
            if (got != a && got != b) ++torn;
            ++reads;
        }
    });
    for (int i = 0; i < 200; ++i) {
        Serve(i % 2 ? a : b);
        ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    }
    fake::WaitFor([&] { return reads > 50; }, std::chrono::seconds(10));
    stop = true;
    reader.join();
    EXPECT_GT(reads, 0);
    EXPECT_EQ(torn, 0);
}

TEST_F(SnapshotFileTest, DeleteRemovesTheFileAndIgnoresAMissingOne) {
    EXPECT_EQ(SnapshotFileDelete(id_), 0);
    EXPECT_TRUE(fake::CameraCalls().empty());
    WriteFile(path_, "x");
    EXPECT_EQ(SnapshotFileDelete(id_), 0);
    EXPECT_FALSE(Exists(path_));
    // A dangling symlink at the path goes too.
    ASSERT_EQ(symlink("/nonexistent/ptz", path_.c_str()), 0);
    EXPECT_EQ(SnapshotFileDelete(id_), 0);
    EXPECT_FALSE(Exists(path_));
}

TEST(SnapshotFilePath, NegativeIdKeepsItsSign) {
    fake::Reset();
    std::string path = "/tmp/ov_snapshot_id_-5.jpg";
    if (Exists(path)) GTEST_SKIP() << "someone else's file";
    Camera camera;
    CameraSettings c;
    c.id = -5;
    c.host = "cam";
    camera.SetSettings(c);
    fake::SetHttpReply(fake::HttpReply().Length("3").Body("neg"));
    ASSERT_EQ(SnapshotFileGet(&camera), 0);
    EXPECT_EQ(ReadFile(path), "neg");
    EXPECT_EQ(SnapshotFileDelete(-5), 0);
    EXPECT_FALSE(Exists(path));
}

}  // namespace
