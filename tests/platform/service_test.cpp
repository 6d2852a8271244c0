// The platform across real processes: System V semaphores (misuse, exclusion, release when a holder
// is killed), pid files, and services under S2S_ROOT started and stopped as detached processes.
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

using s2s_test::ReadFile;
using s2s_test::WaitFor;
using s2s_test::WriteFile;

using s2s_test::Child;

// A key of this test alone, removed again at the end.
struct SemKey {
    const int key = static_cast<int>((std::random_device()() & 0x3fffffff) | 0x10000000);
    ~SemKey() { VLIBCSemRemove(key); }
};

// A second lock through one handle would deadlock: refused. A holder killed while it holds the
// semaphore releases it.
TEST(Semaphore, OneHandleCannotLockTwiceAndCloseOrDeathReleases) {
    SemKey key;
    VLIBSem* sem = VLIBCSemOpen(key.key);
    ASSERT_NE(sem, nullptr);
    EXPECT_LT(VLIBCSemUnlock(sem), 0);  // not held
    EXPECT_EQ(VLIBCSemLock(sem), 0);
    EXPECT_LT(VLIBCSemLock(sem), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_PARAMETER);
    EXPECT_EQ(VLIBCSemUnlock(sem) + VLIBCSemLock(sem), 0);
    EXPECT_EQ(VLIBCSemClose(sem), 0);  // releases
    EXPECT_TRUE(VLIBCSemClose(nullptr) == 0 && VLIBCSemOpen(0) == nullptr);
    int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    Child holder([&] {
        VLIBSem* held = VLIBCSemOpen(key.key);
        if (held == nullptr || VLIBCSemLock(held) != 0 || write(ready[1], "y", 1) != 1) {
            return 2;
        }
        return pause();
    });
    char c;
    ASSERT_EQ(read(ready[0], &c, 1), 1);
    close(ready[0]), close(ready[1]);
    kill(holder.pid(), SIGKILL);
    EXPECT_EQ(holder.Wait(), -1);
    EXPECT_EQ(Child([&] { return alarm(5) + VLIBCSemLock(VLIBCSemOpen(key.key)); }).Wait(), 0);
}

// Without exclusion, the processes' read-modify-writes of a counter would lose increments.
TEST(Semaphore, ExcludesAcrossProcesses) {
    SemKey key;
    s2s_test::TempDir dir;
    const std::string counter = dir / "counter";
    WriteFile(counter, "0");
    auto work = [&] {
        VLIBSem* sem = VLIBCSemOpen(key.key);
        for (int i = 0; i < 50; ++i) {
            if (sem == nullptr || VLIBCSemLock(sem) != 0) {
                return 2;
            }
            WriteFile(counter, std::to_string(std::stol(ReadFile(counter)) + 1));
            if (VLIBCSemUnlock(sem) != 0) {
                return 3;
            }
        }
        return VLIBCSemClose(sem);
    };
    Child a(work), b(work), c(work), d(work);
    for (Child* kid : {&a, &b, &c, &d}) {
        EXPECT_EQ(kid->Wait(), 0);
    }
    EXPECT_EQ(ReadFile(counter), "200");
}

// A root with service and run directories of its own; services installed here stop at the end.
class Service : public ::testing::Test {
  protected:
    Service() : env_("S2S_ROOT", root_.path().c_str()) {
        s2s_test::MakeDirs(S2SPath(S2S_PATH_SERVICE_DIR));
        s2s_test::MakeDirs(S2SPath(S2S_PATH_RUN_DIR));
    }
    ~Service() override {
        for (const std::string& name : installed_) {
            VLIBServicePause(name.c_str());
        }
    }
    void Install(const std::string& name, const std::string& script) {
        std::string path = std::string(S2SPath(S2S_PATH_SERVICE_DIR)) + "/" + name;
        WriteFile(path, script);
        chmod(path.c_str(), 0755);
        installed_.push_back(name);
    }
    static std::string PidFile(const std::string& name) {
        return std::string(S2SPath(S2S_PATH_RUN_DIR)) + "/" + name + ".pid";
    }
    static bool Alive(const std::string& pid_file) {
        return VLIBCProcAliveByPidFile(pid_file.c_str()) != 0;
    }

    s2s_test::TempDir root_;
    s2s_test::ScopedEnv env_;
    std::vector<std::string> installed_;
};

TEST_F(Service, PidFilesAreReadStrictlyAndNameNoDeadOrZombieProcess) {
    const std::string file = root_ / "x.pid";
    EXPECT_FALSE(Alive(file) || VLIBCProcAliveByPidFile(nullptr));  // missing
    WriteFile(file, "  " + std::to_string(getpid()) + "  \n");
    EXPECT_TRUE(Alive(file));
    for (const char* garbage : {"", "abc", "12abc", "-1", "0", "99999999999", "1 2"}) {
        WriteFile(file, garbage);
        EXPECT_FALSE(Alive(file)) << garbage;
    }
    s2s_test::Child child([] { return 0; });
    const std::string stat = "/proc/" + std::to_string(child.pid()) + "/stat";
    WriteFile(file, std::to_string(child.pid()) + "\n");
    ASSERT_TRUE(WaitFor([&] { return ReadFile(stat).find(") Z ") != std::string::npos; }));
    EXPECT_FALSE(Alive(file)) << "a zombie";
    EXPECT_EQ(child.Wait(), 0);
    EXPECT_FALSE(Alive(file)) << "a reaped process";
}

// A started service runs detached (its own session, not our child) with our environment, once;
// starting it again or pausing a paused one is the "already" error. A pid file naming a live
// process of another program (this test) is stale: it is not running and is never signalled.
TEST_F(Service, StartsDetachedOnceAndPausesWithTheAlreadyInStateError) {
    Install("svc", "#!/bin/sh\necho \"$S2S_ROOT\" > \"$S2S_ROOT/env.out\"\nexec sleep 600\n");
    WriteFile(PidFile("svc"), std::to_string(getpid()) + "\n1\n");
    EXPECT_EQ(VLIBServiceIsRunning("svc"), 0);
    EXPECT_NE(VLIBServicePause("svc"), 0);
    ASSERT_EQ(VLIBServiceStart("svc", 0), 0);
    EXPECT_EQ(VLIBServiceIsRunning("svc"), 1);
    const pid_t pid = std::stoi(ReadFile(PidFile("svc")));
    EXPECT_NE(getsid(pid), getsid(0));
    EXPECT_EQ(waitpid(pid, nullptr, WNOHANG), -1);
    ASSERT_TRUE(WaitFor([&] { return ReadFile(root_ / "env.out") == root_.path() + "\n"; }));
    EXPECT_NE(VLIBServiceStart("svc", 0), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_SERVICE_ALREADY);
    EXPECT_EQ(std::stoi(ReadFile(PidFile("svc"))), pid);

    ASSERT_EQ(VLIBServicePause("svc"), 0);
    EXPECT_EQ(VLIBServiceIsRunning("svc"), 0);
    EXPECT_EQ(VLIBCFileExist(PidFile("svc").c_str()), 0);
    WriteFile(root_ / "old.pid", std::to_string(pid));
    EXPECT_FALSE(Alive(root_ / "old.pid"));
    EXPECT_NE(VLIBServicePause("svc"), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_SERVICE_ALREADY);
    WriteFile(PidFile("svc"), "garbage");
    ASSERT_EQ(VLIBServiceStart("svc", 0), 0);  // still installed: starts again
}

TEST_F(Service, UnknownBrokenAndBadlyNamedServicesFail) {
    s2s_test::LogCapture log;
    EXPECT_NE(VLIBServiceStart("nothere", 0), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_SERVICE_UNKNOWN);
    EXPECT_TRUE(log.Contains("No executable for service 'nothere'"));
    Install("broken", "\177ELF not really an executable");
    EXPECT_NE(VLIBServiceStart("broken", 0), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_SERVICE_FAILED);
    EXPECT_TRUE(log.Contains("Fail to start service 'broken'"));
    EXPECT_EQ(VLIBServiceIsRunning("broken"), 0);
    for (const char* bad : {"", "../x", "a/b", "-x", ".hidden", "a b"}) {
        EXPECT_NE(VLIBServiceStart(bad, 0), 0) << bad;
        EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_PARAMETER);
        EXPECT_LT(VLIBServiceIsRunning(bad), 0);
    }
    EXPECT_NE(VLIBServiceStart(nullptr, 0), 0);
}

// The shell ignores TERM (its sleeps are children, so it is the one that must die).
TEST_F(Service, AServiceThatIgnoresSigtermIsKilled) {
    Install("stubborn",
            "#!/bin/sh\ntrap '' TERM\n: >\"$S2S_ROOT/trapped\"\nwhile :; do sleep 0.2; done\n");
    ASSERT_EQ(VLIBServiceStart("stubborn", 0), 0);
    ASSERT_TRUE(WaitFor([&] { return access((root_ / "trapped").c_str(), F_OK) == 0; }));
    ASSERT_EQ(VLIBServicePause("stubborn"), 0);
    EXPECT_EQ(VLIBServiceIsRunning("stubborn"), 0);
}

}  // namespace
