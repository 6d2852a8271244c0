// SimpleFileLock and LockFactory with real flock, across threads and processes.
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <fcntl.h>

#include <atomic>
#include <chrono>
#include <future>
#include <regex>
#include <string>

#include "platform/platform_test_util.h"
#include "s2s_host.h"
#include "support/test_util.h"

namespace {

using S2S::LockFactory;
using S2S::SimpleFileLock;
using s2s_test::LogCapture;
using s2s_test::TempDir;

// Whether another open file description could take the lock right now.
bool LockIsFree(const std::string& path) {
    int fd = open(path.c_str(), O_RDWR);
    if (fd < 0) {
        return false;
    }
    bool free = flock(fd, LOCK_EX | LOCK_NB) == 0;
    close(fd);
    return free;
}

TEST(SimpleFileLock, LockIsReentrantOnOneObjectAndOneUnlockReleases) {
    TempDir dir;
    std::string path = dir / "task.lock";
    SimpleFileLock lock(path);
    struct stat st;
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    EXPECT_EQ(lock.UnLock(), 0);  // never locked
    EXPECT_EQ(lock.ExLock(), 0);
    EXPECT_EQ(lock.ExLock(), 0);
    EXPECT_FALSE(LockIsFree(path));
    EXPECT_EQ(lock.UnLock(), 0);
    EXPECT_TRUE(LockIsFree(path));
    EXPECT_EQ(lock.UnLock(), 0);
}

TEST(SimpleFileLock, MissingDirectoryLogsAndEveryLockFails) {
    LogCapture log;
    TempDir dir;
    std::string path = dir / "missing/task.lock";
    SimpleFileLock lock(path);
    EXPECT_EQ(lock.ExLock(), -1);
    EXPECT_EQ(lock.ExLock(), -1);
    EXPECT_EQ(lock.UnLock(), 0);  // not locked: nothing to do
    EXPECT_TRUE(std::regex_match(
        log.Text(),
        std::regex("\\w+ +\\d+ [\\d:]+ \\[ERROR\\] s2s\\.cpp\\(\\d+\\): Fail to open lock "
                   "file at '" +
                   path + "', error:'No such file or directory'\n")))
        << log.Text();
}

TEST(LockFactory, TwoLocksFromOneFactoryExcludeEachOtherInOneProcess) {
    TempDir dir;
    LockFactory factory(dir / "f.lock");
    SimpleFileLock first = factory.GetLock();
    SimpleFileLock second = factory.GetLock();
    ASSERT_EQ(first.ExLock(), 0);
    std::atomic<bool> taken(false);
    auto waiter = std::async(std::launch::async, [&] {
        int rc = second.ExLock();
        taken = true;
        return rc;
    });
    EXPECT_EQ(waiter.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);
    EXPECT_FALSE(taken);
    ASSERT_EQ(first.UnLock(), 0);
    EXPECT_EQ(waiter.get(), 0);
    EXPECT_EQ(second.UnLock(), 0);
}

TEST(SimpleFileLock, MovedLockKeepsItsDescriptorAndState) {
    TempDir dir;
    std::string path = dir / "m.lock";
    SimpleFileLock original(path);
    ASSERT_EQ(original.ExLock(), 0);
    SimpleFileLock moved(std::move(original));
    EXPECT_FALSE(LockIsFree(path));
    EXPECT_EQ(original.ExLock(), -1);  // NOLINT(bugprone-use-after-move): emptied on purpose
    EXPECT_EQ(moved.UnLock(), 0);
    EXPECT_TRUE(LockIsFree(path));
}

// Another process holds the lock while this one blocks on it; the holder destroys its lock object
// (and only later exits), which must let this process in. The lock file stays.
// The holder is a separate process from the start: a forked copy of a held descriptor would keep
// the lock alive on its own.
TEST(SimpleFileLock, DestroyingAHeldLockReleasesABlockedProcess) {
    TempDir dir;
    std::string path = dir / "shared.lock";
    int locked[2];
    int go[2];
    ASSERT_EQ(pipe(locked), 0);
    ASSERT_EQ(pipe(go), 0);
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        close(locked[0]);
        close(go[1]);
        char c = 0;
        {
            SimpleFileLock holder = LockFactory(path).GetLock();
            c = holder.ExLock() == 0 ? 'y' : 'n';
            if (write(locked[1], &c, 1) != 1 || read(go[0], &c, 1) != 1) {
                _exit(2);
            }
        }
        // Destroyed: released. Stay alive until told, so process exit cannot be what released it.
        _exit(read(go[0], &c, 1) == 1 ? 0 : 3);
    }
    close(locked[1]);
    close(go[0]);
    char c = 0;
    ASSERT_EQ(read(locked[0], &c, 1), 1);
    ASSERT_EQ(c, 'y');

    SimpleFileLock mine(path);
    auto waiter = std::async(std::launch::async, [&] { return mine.ExLock(); });
    EXPECT_EQ(waiter.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);
    ASSERT_EQ(write(go[1], "1", 1), 1);  // the holder destroys its lock
    EXPECT_EQ(waiter.get(), 0);
    ASSERT_EQ(write(go[1], "2", 1), 1);  // now it may exit
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    close(locked[0]);
    close(go[1]);
    EXPECT_EQ(access(path.c_str(), F_OK), 0);
}

}  // namespace
