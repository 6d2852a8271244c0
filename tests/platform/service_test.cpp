// Pid-file checks and service control with real detached processes, under S2S_ROOT.
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <string>

#include "platform/platform_test_util.h"
#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

using s2s_test::ReadFile;
using s2s_test::ScopedEnv;
using s2s_test::TempDir;
using s2s_test::WaitFor;
using s2s_test::WriteFile;

TEST(ProcAliveByPidFile, ReadsPidFilesStrictly) {
    TempDir dir;
    std::string file = dir / "x.pid";
    EXPECT_EQ(VLIBCProcAliveByPidFile(file.c_str()), 0);  // missing
    EXPECT_EQ(VLIBCProcAliveByPidFile(nullptr), 0);
    WriteFile(file, "  " + std::to_string(getpid()) + "  \n");
    EXPECT_NE(VLIBCProcAliveByPidFile(file.c_str()), 0);
    for (const char* garbage : {"", "abc", "12abc", "-1", "0", "99999999999", "1 2"}) {
        WriteFile(file, garbage);
        EXPECT_EQ(VLIBCProcAliveByPidFile(file.c_str()), 0) << garbage;
    }
}

TEST(ProcAliveByPidFile, DeadAndZombieProcessesAreNotAlive) {
    TempDir dir;
    std::string file = dir / "x.pid";
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        _exit(0);
    }
    WriteFile(file, std::to_string(child) + "\n");
    // Not reaped yet: a zombie.
    ASSERT_TRUE(WaitFor([&] {
        std::string stat = ReadFile("/proc/" + std::to_string(child) + "/stat");
        return stat.find(") Z ") != std::string::npos;
    }));
    EXPECT_EQ(VLIBCProcAliveByPidFile(file.c_str()), 0);
    int status;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(VLIBCProcAliveByPidFile(file.c_str()), 0);
}

bool IgnoresSigterm(pid_t pid) {
    std::string status = ReadFile("/proc/" + std::to_string(pid) + "/status");
    size_t at = status.find("SigIgn:\t");
    return at != std::string::npos &&
           (std::stoull(status.substr(at + 8, 16), nullptr, 16) & (1ull << (SIGTERM - 1))) != 0;
}

// A root with a service directory and run directory of its own.
class ServiceTest : public ::testing::Test {
  protected:
    ServiceTest() : env_("S2S_ROOT", root_.path().c_str()) {
        bin_ = std::string(S2SPath(S2S_PATH_SERVICE_DIR));
        EXPECT_EQ(system(("mkdir -p '" + bin_ + "'").c_str()), 0);
    }
    ~ServiceTest() override {
        for (const std::string& name : started_) {
            VLIBServicePause(name.c_str());
        }
    }
    void Install(const std::string& name, const std::string& script) {
        std::string path = bin_ + "/" + name;
        WriteFile(path, script);
        chmod(path.c_str(), 0755);
        started_.push_back(name);
    }
    std::string PidFile(const std::string& name) {
        return std::string(S2SPath(S2S_PATH_RUN_DIR)) + "/" + name + ".pid";
    }
    pid_t Pid(const std::string& name) { return std::stoi(ReadFile(PidFile(name))); }

    TempDir root_;
    ScopedEnv env_;
    std::string bin_;
    std::vector<std::string> started_;
};

TEST_F(ServiceTest, StartIsRunningPauseAndTheAlreadyInStateError) {
    Install("svc", "#!/bin/sh\necho \"$S2S_ROOT\" > \"$S2S_ROOT/env.out\"\nexec sleep 600\n");
    EXPECT_EQ(VLIBServiceIsRunning("svc"), 0);
    ASSERT_EQ(VLIBServiceStart("svc", 0), 0);
    EXPECT_EQ(VLIBCErrGet(), 0);
    EXPECT_EQ(VLIBServiceIsRunning("svc"), 1);
    pid_t pid = Pid("svc");
    EXPECT_NE(VLIBCProcAliveByPidFile(PidFile("svc").c_str()), 0);
    // Detached: its own session, and not a child of this process.
    EXPECT_NE(getsid(pid), getsid(0));
    EXPECT_EQ(waitpid(pid, nullptr, WNOHANG), -1);
    // The environment (and so S2S_ROOT) reaches the service.
    ASSERT_TRUE(WaitFor([&] { return ReadFile(root_ / "env.out") == root_.path() + "\n"; }));

    EXPECT_NE(VLIBServiceStart("svc", 0), 0);
    EXPECT_EQ(VLIBCErrGet(), 0xEB00);
    EXPECT_EQ(Pid("svc"), pid);  // no second instance

    ASSERT_EQ(VLIBServicePause("svc"), 0);
    EXPECT_EQ(VLIBServiceIsRunning("svc"), 0);
    EXPECT_EQ(VLIBCFileExist(PidFile("svc").c_str()), 0);
    std::string old_pid = root_ / "old.pid";
    WriteFile(old_pid, std::to_string(pid));
    EXPECT_EQ(VLIBCProcAliveByPidFile(old_pid.c_str()), 0);  // gone (at most a zombie of init)
    EXPECT_NE(VLIBServicePause("svc"), 0);
    EXPECT_EQ(VLIBCErrGet(), 0xEB00);

    // The service stays installed: it starts again.
    ASSERT_EQ(VLIBServiceStart("svc", 0), 0);
    EXPECT_EQ(VLIBServiceIsRunning("svc"), 1);
}

TEST_F(ServiceTest, UnknownBrokenAndBadlyNamedServices) {
    s2s_test::LogCapture log;
    EXPECT_NE(VLIBServiceStart("nothere", 0), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_SERVICE_UNKNOWN);
    EXPECT_TRUE(log.Contains("No executable for service 'nothere'"));

    Install("broken",
            "\x7f"
            "ELF not really an executable");
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

TEST_F(ServiceTest, StalePidFilesDoNotCountAsRunning) {
    Install("svc", "#!/bin/sh\nexec sleep 600\n");
    ASSERT_EQ(system(("mkdir -p '" + std::string(S2SPath(S2S_PATH_RUN_DIR)) + "'").c_str()), 0);
    // A pid that is alive but belongs to another program started at another time.
    WriteFile(PidFile("svc"), std::to_string(getpid()) + "\n1\n");
    EXPECT_EQ(VLIBServiceIsRunning("svc"), 0);
    EXPECT_NE(VLIBServicePause("svc"), 0);  // must not signal this test process
    EXPECT_EQ(VLIBCErrGet(), 0xEB00);
    WriteFile(PidFile("svc"), "garbage");
    EXPECT_EQ(VLIBServiceIsRunning("svc"), 0);
    ASSERT_EQ(VLIBServiceStart("svc", 0), 0);
    EXPECT_EQ(VLIBServiceIsRunning("svc"), 1);
}

TEST_F(ServiceTest, AServiceThatIgnoresSigtermIsKilled) {
    // The shell ignores TERM; it runs its sleeps as children, so it is the one that must die.
    Install("stubborn", "#!/bin/sh\ntrap '' TERM\nwhile :; do sleep 0.2; done\n");
    ASSERT_EQ(VLIBServiceStart("stubborn", 0), 0);
    pid_t pid = Pid("stubborn");
    ASSERT_TRUE(WaitFor([&] { return IgnoresSigterm(pid); }));
    ASSERT_EQ(VLIBServicePause("stubborn"), 0);
    EXPECT_EQ(VLIBServiceIsRunning("stubborn"), 0);
}

}  // namespace
