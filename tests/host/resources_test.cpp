// The host's resources under S2S_ROOT: file locks (across threads and processes), temporary files
// in their private directory, the receiver's daemon started and stopped as a real detached
// process, and the control socket's client giving up on a service that accepts and never answers.
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <regex>
#include <string>

#include "s2s_control.h"
#include "s2s_control_client.h"
#include "s2s_host.h"
#include "s2s_ipc.h"
#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

using S2S::LockFactory;
using S2S::SimpleFileLock;
using s2s_test::LogCapture;

class HostRoot : public ::testing::Test {
  protected:
    HostRoot() : env_("S2S_ROOT", root_.path().c_str()) {}
    s2s_test::TempDir root_;
    s2s_test::ScopedEnv env_;
    const std::string tmp_ = root_ / "tmp/S2S";
};

// Whether another open file description could take the lock right now.
bool LockIsFree(const std::string& path) {
    int fd = open(path.c_str(), O_RDWR);
    bool free = fd >= 0 && flock(fd, LOCK_EX | LOCK_NB) == 0;
    close(fd);
    return free;
}

TEST_F(HostRoot, SimpleFileLockIsReentrantOneUnlockReleasesAMoveKeepsItAMissingDirFails) {
    const std::string path = root_ / "task.lock";
    SimpleFileLock lock(path);
    struct stat st;
    EXPECT_TRUE(stat(path.c_str(), &st) == 0 && (st.st_mode & 0777) == 0600);
    EXPECT_EQ(lock.UnLock(), 0);  // never locked
    EXPECT_EQ(lock.ExLock() + lock.ExLock(), 0);
    EXPECT_FALSE(LockIsFree(path));
    EXPECT_EQ(lock.UnLock(), 0);
    EXPECT_TRUE(LockIsFree(path));
    ASSERT_EQ(lock.ExLock(), 0);
    SimpleFileLock moved(std::move(lock));
    EXPECT_FALSE(LockIsFree(path));
    EXPECT_EQ(lock.ExLock(), -1);  // NOLINT(bugprone-use-after-move): emptied on purpose
    EXPECT_EQ(moved.UnLock(), 0);
    EXPECT_TRUE(LockIsFree(path));

    LogCapture log;
    SimpleFileLock nowhere(root_ / "missing/task.lock");
    EXPECT_EQ(nowhere.ExLock() + nowhere.ExLock(), -2);
    EXPECT_EQ(nowhere.UnLock(), 0);  // not locked: nothing to do
    EXPECT_TRUE(log.Contains("): Fail to open lock file at '" + root_ / "missing/task.lock" +
                             "', error:'No such file or directory'\n"));
}

// Each lock of a factory is an open file description of its own, so two locks of one factory
// exclude each other even in one process. A lock held in another process blocks this one until
// the holder destroys its lock object (it exits only later, so exit is not what released it).
// The holder is a process from the start: a forked copy of a held descriptor would keep the lock
// alive on its own.
TEST_F(HostRoot, FactoryLocksExcludeEachOtherAndDestroyingAHeldOneReleasesAWaitingProcess) {
    const std::string path = root_ / "shared.lock";
    LockFactory factory(path);
    SimpleFileLock first = factory.GetLock(), second = factory.GetLock();
    ASSERT_EQ(first.ExLock(), 0);
    auto waiter = std::async(std::launch::async, [&] { return second.ExLock(); });
    EXPECT_EQ(waiter.wait_for(std::chrono::milliseconds(100)), std::future_status::timeout);
    ASSERT_EQ(first.UnLock(), 0);
    EXPECT_EQ(waiter.get(), 0);
    ASSERT_EQ(second.UnLock(), 0);

    int locked[2], go[2];
    ASSERT_EQ(pipe(locked) + pipe(go), 0);
    s2s_test::Child holder([&] {
        char c = 0;
        {
            SimpleFileLock held = LockFactory(path).GetLock();
            if (held.ExLock() != 0 || write(locked[1], "y", 1) != 1 || read(go[0], &c, 1) != 1) {
                return 2;
            }
        }
        return read(go[0], &c, 1) == 1 ? 0 : 3;
    });
    char c = 0;
    ASSERT_EQ(read(locked[0], &c, 1), 1);
    SimpleFileLock mine(path);
    auto blocked = std::async(std::launch::async, [&] { return mine.ExLock(); });
    EXPECT_EQ(blocked.wait_for(std::chrono::milliseconds(100)), std::future_status::timeout);
    ASSERT_EQ(write(go[1], "1", 1), 1);  // the holder destroys its lock
    EXPECT_EQ(blocked.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    ASSERT_EQ(write(go[1], "2", 1), 1);  // now it may exit
    EXPECT_EQ(blocked.get(), 0);
    EXPECT_EQ(holder.Wait(), 0);
    close(locked[0]), close(locked[1]), close(go[0]), close(go[1]);
}

// An empty file reserves each name, in a directory of our own made at first use.
TEST_F(HostRoot, TempFilesAreReservedInAPrivateDirectoryMadeAtFirstUse) {
    const std::string a = S2S::GetTempFile(), b = S2S::GetTempFile();
    struct stat st;
    ASSERT_EQ(lstat(tmp_.c_str(), &st), 0);
    EXPECT_TRUE(S_ISDIR(st.st_mode) && (st.st_mode & 07777) == 0700 && st.st_uid == geteuid());
    EXPECT_TRUE(std::regex_match(a, std::regex(tmp_ + "/temp\\.[A-Za-z0-9]{6}"))) << a;
    EXPECT_NE(a, b);
    EXPECT_TRUE(stat(a.c_str(), &st) == 0 && st.st_size == 0);
    S2S::PutTempFile(a);
    EXPECT_TRUE(!S2S::IsPathExist(a) && S2S::IsPathExist(b));
    ASSERT_EQ(symlink("nowhere", (root_ / "dangling").c_str()), 0);
    EXPECT_FALSE(S2S::IsPathExist(root_ / "dangling"));
    LogCapture log;
    S2S::PutTempFile("");
    EXPECT_EQ(log.Text(), "");
    S2S::PutTempFile(a);
    EXPECT_TRUE(log.Contains("Fail to unlink temp file '" + a + "' [2]\n"));
}

// Another user who can write the directory could swap a reserved name for a link and have a
// command's output written where the link points: such a directory is refused, saying why.
TEST_F(HostRoot, ATempDirectoryOpenToOthersNotOursOrALinkIsRefused) {
    std::string error;
    ASSERT_NE(S2S::GetTempFile(error), "") << error;
    ASSERT_EQ(chmod(tmp_.c_str(), 01777), 0);
    LogCapture log;
    EXPECT_EQ(S2S::GetTempFile(), "");
    EXPECT_TRUE(log.Contains("has mode 1777") && log.Contains("chmod 700 " + tmp_)) << log.Text();
    ASSERT_EQ(chmod(tmp_.c_str(), 0700), 0);
    if (geteuid() == 0) {
        ASSERT_EQ(chown(tmp_.c_str(), 65534, 65534), 0);
        EXPECT_EQ(S2S::GetTempFile(error), "");
        EXPECT_NE(error.find("belongs to user 65534, not to root"), std::string::npos) << error;
    }
    s2s_test::RemoveTree(tmp_);
    ASSERT_EQ(symlink(root_.path().c_str(), tmp_.c_str()), 0);
    EXPECT_EQ(S2S::GetTempFile(error), "");
    EXPECT_NE(error.find("is not a directory"), std::string::npos) << error;
}

// Starting a running daemon counts as success (the platform's "already" error); stopping a
// stopped one is a failure; both failures name the platform's error.
TEST_F(HostRoot, DaemonStartsOnceStopsAndReportsThePlatformsError) {
    LogCapture log;
    const std::string dir = S2SPath(S2S_PATH_SERVICE_DIR);
    s2s_test::MakeDirs(dir);
    EXPECT_EQ(S2S::StartDaemon(), -1);
    EXPECT_TRUE(log.Contains("Fail to start daemon, vurnerr=[0xEB01]"));
    s2s_test::WriteFile(dir + "/s2s_daemon", "#!/bin/sh\nexec sleep 600\n");
    chmod((dir + "/s2s_daemon").c_str(), 0755);
    EXPECT_FALSE(S2S::IsDaemonRunning());
    ASSERT_EQ(S2S::StartDaemon(), 0);
    EXPECT_TRUE(S2S::IsDaemonRunning() && S2S::StartDaemon() == 0);
    ASSERT_EQ(S2S::StopDaemon(), 0);
    EXPECT_FALSE(S2S::IsDaemonRunning());
    EXPECT_EQ(S2S::StopDaemon(), -1);
    EXPECT_TRUE(log.Contains("Fail to stop daemon, vurnerr=[0xEB00]")) << log.Text();
}

TEST_F(HostRoot, TheControlClientGivesUpOnAServiceThatAcceptsAndStaysSilent) {
    s2s_test::MakeDirs(root_ / "run/s2s", 0700);
    S2S::IPCListener listener;
    ASSERT_EQ(listener.prepare(root_.path() + S2S::Control::kSocketPath), 0);
    const auto start = std::chrono::steady_clock::now();
    std::string error;
    std::future<int> asked = std::async(std::launch::async, [&] {
        S2S::PObject request, reply;
        request[S2S::Control::kKeyCommand] = S2S::Control::kList;
        return S2S::Control::Request(request, reply, error, 1);
    });
    ASSERT_TRUE(listener.isReady());
    S2S::IPCSender accepted;
    ASSERT_EQ(accepted.assign(listener.accept()), 0);
    ASSERT_EQ(asked.wait_for(std::chrono::seconds(20)), std::future_status::ready)
        << "the request still waits for the silent service";
    EXPECT_EQ(asked.get(), -1);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(10));
    EXPECT_NE(error.find("did not answer"), std::string::npos) << error;
}

}  // namespace
