// Temporary files and daemon control under S2S_ROOT, with a real detached daemon process.
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <regex>
#include <string>

#include "platform/platform_test_util.h"
#include "s2s_host.h"
#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

using s2s_test::LogCapture;
using s2s_test::ScopedEnv;
using s2s_test::TempDir;

class HostRoot : public ::testing::Test {
  protected:
    HostRoot() : env_("S2S_ROOT", root_.path().c_str()) {}
    void MakeDir(const std::string& dir) {
        ASSERT_EQ(system(("mkdir -p '" + dir + "'").c_str()), 0);
    }
    TempDir root_;
    ScopedEnv env_;
};

TEST_F(HostRoot, TempFilesLiveInAPrivateDirectoryMadeAtFirstUse) {
    const std::string dir = root_ / "tmp/S2S";
    std::string a = S2S::GetTempFile();
    std::string b = S2S::GetTempFile();
    struct stat st;
    ASSERT_EQ(lstat(dir.c_str(), &st), 0);
    EXPECT_TRUE(S_ISDIR(st.st_mode));
    EXPECT_EQ(st.st_mode & 07777, 0700u);
    EXPECT_EQ(st.st_uid, geteuid());
    std::string prefix = dir + "/temp.";
    ASSERT_EQ(a.compare(0, prefix.size(), prefix), 0) << a;
    EXPECT_EQ(a.size(), prefix.size() + 6);
    EXPECT_NE(a, b);
    ASSERT_EQ(stat(a.c_str(), &st), 0);  // the empty file reserves the name
    EXPECT_EQ(st.st_size, 0);
    EXPECT_TRUE(S2S::IsPathExist(a));
    S2S::PutTempFile(a);
    EXPECT_FALSE(S2S::IsPathExist(a));
    S2S::PutTempFile(b);
}

// Another user who can write the directory can swap a reserved name for a link and have a
// command's output written where the link points: such a directory is refused, saying why.
TEST_F(HostRoot, TempDirectoryOpenToOthersOrNotOursIsRefused) {
    const std::string dir = root_ / "tmp/S2S";
    std::string error;
    ASSERT_NE(S2S::GetTempFile(error), "") << error;
    ASSERT_EQ(chmod(dir.c_str(), 01777), 0);
    LogCapture log;
    EXPECT_EQ(S2S::GetTempFile(), "");
    EXPECT_TRUE(log.Contains("has mode 1777")) << log.Text();
    EXPECT_TRUE(log.Contains("chmod 700 " + dir)) << log.Text();
    ASSERT_EQ(chmod(dir.c_str(), 0700), 0);
    if (geteuid() == 0) {
        ASSERT_EQ(chown(dir.c_str(), 65534, 65534), 0);
        EXPECT_EQ(S2S::GetTempFile(error), "");
        EXPECT_NE(error.find("belongs to user 65534, not to root"), std::string::npos) << error;
        ASSERT_EQ(chown(dir.c_str(), 0, 0), 0);
    }
    s2s_test::RemoveTree(dir);
    ASSERT_EQ(symlink(root_.path().c_str(), dir.c_str()), 0);
    EXPECT_EQ(S2S::GetTempFile(error), "");
    EXPECT_NE(error.find("is not a directory"), std::string::npos) << error;
}

TEST_F(HostRoot, PutTempFileLogsAFailedUnlinkAndIgnoresAnEmptyPath) {
    LogCapture log;
    S2S::PutTempFile("");
    EXPECT_EQ(log.Text(), "");
    std::string missing = root_ / "tmp/S2S/temp.gone00";
    S2S::PutTempFile(missing);
    EXPECT_TRUE(std::regex_search(
        log.Text(), std::regex("\\[ERROR\\] s2s\\.cpp\\(\\d+\\): Fail to unlink temp file '" +
                               missing + "' \\[2\\]\n$")))
        << log.Text();
}

TEST(IsPathExist, AnyKindOfEntry) {
    TempDir dir;
    EXPECT_TRUE(S2S::IsPathExist(dir.path()));
    EXPECT_FALSE(S2S::IsPathExist(dir / "nothing"));
    ASSERT_EQ(symlink("nowhere", (dir / "dangling").c_str()), 0);
    EXPECT_FALSE(S2S::IsPathExist(dir / "dangling"));  // access() follows the link
    EXPECT_FALSE(S2S::IsPathExist(""));
}

class Daemon : public HostRoot {
  protected:
    Daemon() {
        std::string bin = S2SPath(S2S_PATH_SERVICE_DIR);
        MakeDir(bin);
        exe_ = bin + "/s2s_daemon";
    }
    ~Daemon() override { VLIBServicePause("s2s_daemon"); }
    void Install() {
        s2s_test::WriteFile(exe_, "#!/bin/sh\nexec sleep 600\n");
        chmod(exe_.c_str(), 0755);
    }
    std::string exe_;
};

TEST_F(Daemon, StartStopAndTheAlreadyRunningCase) {
    LogCapture log;
    Install();
    EXPECT_FALSE(S2S::IsDaemonRunning());
    ASSERT_EQ(S2S::StartDaemon(), 0);
    EXPECT_TRUE(S2S::IsDaemonRunning());
    // Already running: the platform reports 0xEB00, which counts as success.
    EXPECT_EQ(S2S::StartDaemon(), 0);
    EXPECT_EQ(VLIBCErrGet(), 0xEB00);
    EXPECT_EQ(log.Text(), "");
    ASSERT_EQ(S2S::StopDaemon(), 0);
    EXPECT_FALSE(S2S::IsDaemonRunning());
    // Stopping a stopped daemon is a failure, logged without a trailing newline.
    EXPECT_EQ(S2S::StopDaemon(), -1);
    EXPECT_TRUE(std::regex_search(
        log.Text(),
        std::regex("\\[ERROR\\] s2s\\.cpp\\(\\d+\\): Fail to stop daemon, vurnerr=\\[0xEB00\\]$")))
        << log.Text();
}

TEST_F(Daemon, StartWithoutAnExecutableFails) {
    LogCapture log;
    EXPECT_EQ(S2S::StartDaemon(), -1);
    EXPECT_FALSE(S2S::IsDaemonRunning());
    EXPECT_TRUE(std::regex_search(
        log.Text(),
        std::regex("\\[ERROR\\] s2s\\.cpp\\(\\d+\\): Fail to start daemon, vurnerr=\\[0xEB01\\]$")))
        << log.Text();
}

}  // namespace
