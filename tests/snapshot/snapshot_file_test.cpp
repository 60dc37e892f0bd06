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

std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

bool Exists(const std::string& path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

class SnapshotFileTest : public ::testing::Test {
protected:
    void SetUp() override {
        fake::Reset();
        id_ = 700000000 + getpid() % 1000000;  // a file of this process only
        path_ = "/tmp/ov_snapshot_id_" + std::to_string(id_) + ".jpg";
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
        EXPECT_TRUE(fake::LogTexts().empty());
        // No temp file left behind.
        std::string prefix = "ov_snapshot_id_" + std::to_string(id_) + ".jpg.";
        DIR* dir = opendir("/tmp");
        while (dirent* e = dir ? readdir(dir) : nullptr) EXPECT_NE(std::string(e->d_name).rfind(prefix, 0), 0u);
        if (dir) closedir(dir);
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

TEST_F(SnapshotFileTest, WritesTheImageWithWhicheverControlObjectTheFactoriesGive) {
    EXPECT_EQ(SnapshotFileGet(nullptr), -1);
    EXPECT_TRUE(fake::CameraCalls().empty());
    const std::string vendor = "newCameraAPI cam 8000 admin pw onvif M1 2";
    const std::string user = "newUserDefinedAPI cam 8000 admin pw /user/path.jpg 1";
    const Calls rest = {"SetReso 1280x720", "GetSnapshotPath", "releaseCameraAPI"};
    struct Case {
        bool apiNull, userApiNull;
        Calls factories;
    } cases[] = {{false, true, {vendor}}, {true, false, {vendor, user}}};
    for (const Case& c : cases) {
        fake::Reset();
        fake::CameraHost("cam").apiNull = c.apiNull;
        fake::CameraHost("cam").userApiNull = c.userApiNull;
        Serve(c.apiNull ? "user image" : "vendor image");
        mode_t old = umask(027);
        ASSERT_EQ(SnapshotFileGet(&camera_), 0);
        umask(old);
        EXPECT_EQ(ReadFile(path_), c.apiNull ? "user image" : "vendor image");
        Calls expected = c.factories;
        expected.insert(expected.end(), rest.begin(), rest.end());
        EXPECT_EQ(fake::CameraCallNames(), expected);
        struct stat st;
        ASSERT_EQ(stat(path_.c_str(), &st), 0);
        EXPECT_EQ(st.st_mode & 0777, 0640u);  // what fopen would give under that umask
    }
    Serve("");  // an empty image without Content-Length: an empty file
    fake::SetHttpReply({});
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    EXPECT_TRUE(Exists(path_));
    EXPECT_EQ(ReadFile(path_), "");
}

TEST_F(SnapshotFileTest, FailuresLeaveTheOldFileAsItWas) {
    std::ofstream(path_) << "old image";
    fake::CameraHost("cam").apiNull = true;  // and no user-defined object either
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    EXPECT_TRUE(fake::HttpExchanges().empty());
    fake::CameraHost("cam").apiNull = false;
    fake::SetHttpReply(fake::HttpReply().Code(404));
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    fake::SetHttpReply(fake::HttpReply().Length("100").Body("short"));
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
    EXPECT_EQ(ReadFile(path_), "old image");
    // A directory at the path: the replace fails and leaves no temp file (see TearDown).
    Cleanup();
    ASSERT_EQ(mkdir(path_.c_str(), 0700), 0);
    EXPECT_EQ(SnapshotFileGet(&camera_), -1);
}

TEST_F(SnapshotFileTest, APlantedSymlinkIsReplacedNotFollowed) {
    std::string victim = "/tmp/ptz_snapshot_victim_" + std::to_string(getpid());
    std::ofstream(victim) << "precious";
    ASSERT_EQ(symlink(victim.c_str(), path_.c_str()), 0);
    ASSERT_EQ(SnapshotFileGet(&camera_), 0);
    struct stat st;
    ASSERT_EQ(lstat(path_.c_str(), &st), 0);
    EXPECT_TRUE(S_ISREG(st.st_mode));
    EXPECT_EQ(ReadFile(path_), "image one");
    EXPECT_EQ(ReadFile(victim), "precious");
    unlink(victim.c_str());
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
            torn += got != a && got != b;
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
    std::ofstream(path_) << "x";
    EXPECT_EQ(SnapshotFileDelete(id_), 0);
    EXPECT_FALSE(Exists(path_));
    ASSERT_EQ(symlink("/nonexistent/ptz", path_.c_str()), 0);  // a dangling symlink goes too
    EXPECT_EQ(SnapshotFileDelete(id_), 0);
    EXPECT_FALSE(Exists(path_));
    EXPECT_TRUE(fake::CameraCalls().empty());
}

}  // namespace
