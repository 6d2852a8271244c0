// The wrapper's child runner: exit codes and merged output lines, a process group that never
// outlives the run, and no timer between a child's end and the return of the call.
#include <dirent.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <string>
#include <vector>

#include "gtest/gtest.h"
#include "rsync/child_process.h"
#include "support/test_util.h"

namespace {

using S2S::rsync_internal::ChildCommand;
using S2S::rsync_internal::ChildOutcome;
using S2S::rsync_internal::RunChild;

ChildOutcome Sh(const std::string& script, std::vector<std::string>* lines,
                const boost::function<bool()>& cancel = boost::function<bool()>()) {
    ChildCommand job;
    job.argv = {"/bin/sh", "-c", script};
    return RunChild(job, cancel, [lines](const std::string& line) { lines->push_back(line); });
}

// Processes (zombies aside) whose command line holds `needle`.
int LiveProcessesMentioning(const std::string& needle) {
    int n = 0;
    DIR* d = opendir("/proc");
    while (struct dirent* e = d != nullptr ? readdir(d) : nullptr) {
        if (e->d_name[0] < '1' || e->d_name[0] > '9' || atoi(e->d_name) == getpid()) {
            continue;
        }
        std::string cmd = s2s_test::ReadFile(std::string("/proc/") + e->d_name + "/cmdline");
        std::string stat = s2s_test::ReadFile(std::string("/proc/") + e->d_name + "/stat");
        size_t paren = stat.rfind(')');
        bool zombie =
            paren != std::string::npos && paren + 2 < stat.size() && stat[paren + 2] == 'Z';
        n += !zombie && cmd.find(needle) != std::string::npos;
    }
    if (d != nullptr) {
        closedir(d);
    }
    return n;
}

double Millis(std::chrono::steady_clock::duration d) {
    return std::chrono::duration<double, std::milli>(d).count();
}

TEST(ChildProcess, ExitCodeAndMergedLines) {
    std::vector<std::string> lines;
    ChildOutcome out =
        Sh("printf 'one\\ntwo\\r' ; printf 'err\\n' >&2; printf tail; exit 7", &lines);
    ASSERT_TRUE(out.started) << out.error;
    EXPECT_FALSE(out.cancelled);
    EXPECT_EQ(out.exit_code, 7);
    EXPECT_EQ(lines, (std::vector<std::string>{"one", "two", "err", "tail"}));

    lines.clear();
    out = Sh("kill -TERM $$", &lines);
    EXPECT_EQ(out.exit_code, -1);
    EXPECT_EQ(out.signal, SIGTERM);

    ChildCommand missing;
    missing.argv = {"/nonexistent/program"};
    out = RunChild(missing, boost::function<bool()>(), nullptr);
    EXPECT_FALSE(out.started);
    EXPECT_NE(out.error, "");
}

// A child that leaves a process behind holding its output: the call returns when the child ends
// (not when a poll interval runs out), and the leftover process goes with it.
TEST(ChildProcess, ReturnsWhenTheChildEndsEvenWhileItsOutputStaysOpen) {
    const std::string marker = "s2s-child-test-" + std::to_string(getpid());
    double fastest = 1e9;
    for (int i = 0; i < 3; ++i) {
        std::vector<std::string> lines;
        auto start = std::chrono::steady_clock::now();
        ChildOutcome out = Sh("(sleep 30; echo " + marker + ") & echo started; sleep 0.01; exit 3",
                              &lines, [] { return false; });  // a predicate to ask, as the sync has
        fastest = std::min(fastest, Millis(std::chrono::steady_clock::now() - start));
        EXPECT_EQ(out.exit_code, 3);
        EXPECT_EQ(lines, std::vector<std::string>{"started"});
    }
    // The predicate is asked every 100 ms; the child's end must not wait for that.
    EXPECT_LT(fastest, 70.0);
    EXPECT_TRUE(s2s_test::WaitFor([&] { return LiveProcessesMentioning(marker) == 0; }))
        << "the background shell outlived the run";
}

TEST(ChildProcess, CancelEndsTheWholeGroupEvenWhenItIgnoresSigterm) {
    const std::string marker = "s2s-cancel-test-" + std::to_string(getpid());
    std::vector<std::string> lines;
    auto asked = std::chrono::steady_clock::now();
    bool up = false;
    ChildOutcome out =
        Sh("trap '' TERM; (sleep 30; echo " + marker + ") & echo up; wait", &lines, [&] {
            if (!up && !lines.empty()) {
                up = true;
                asked = std::chrono::steady_clock::now();
            }
            return up;
        });
    EXPECT_TRUE(out.cancelled);
    // SIGKILL follows SIGTERM after a grace period of 3 s.
    EXPECT_LT(Millis(std::chrono::steady_clock::now() - asked), 6000.0);
    EXPECT_EQ(LiveProcessesMentioning(marker), 0) << "a process of the group survived";
}

}  // namespace
