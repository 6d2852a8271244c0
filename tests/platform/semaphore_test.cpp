// System V semaphores across real processes: exclusion, and release when a holder is killed.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <random>

#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

// A key of this test process alone, removed again at the end.
class SemKey {
  public:
    SemKey() {
        std::random_device rd;
        key_ = static_cast<int>((rd() & 0x3fffffff) | 0x10000000);
    }
    ~SemKey() { VLIBCSemRemove(key_); }
    int get() const { return key_; }

  private:
    int key_;
};

TEST(Semaphore, LockUnlockAndMisuse) {
    SemKey key;
    VLIBSem* sem = VLIBCSemOpen(key.get());
    ASSERT_NE(sem, nullptr);
    EXPECT_LT(VLIBCSemUnlock(sem), 0);  // not held
    EXPECT_EQ(VLIBCSemLock(sem), 0);
    EXPECT_LT(VLIBCSemLock(sem), 0);  // a second lock through one handle would deadlock
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_PARAMETER);
    EXPECT_EQ(VLIBCSemUnlock(sem), 0);
    EXPECT_EQ(VLIBCSemLock(sem), 0);
    EXPECT_EQ(VLIBCSemClose(sem), 0);  // releases
    VLIBSem* again = VLIBCSemOpen(key.get());
    ASSERT_NE(again, nullptr);
    EXPECT_EQ(VLIBCSemLock(again), 0);
    EXPECT_EQ(VLIBCSemClose(again), 0);
    EXPECT_EQ(VLIBCSemClose(nullptr), 0);
    EXPECT_EQ(VLIBCSemOpen(0), nullptr);
}

// Several processes increment a counter file under the semaphore; without exclusion their
// read-modify-writes would overlap and lose increments.
TEST(Semaphore, ExcludesAcrossProcesses) {
    SemKey key;
    s2s_test::TempDir dir;
    std::string shared = dir / "counter";
    s2s_test::WriteFile(shared, "0\n");
    const char* shared_path = shared.c_str();
    constexpr int kProcs = 4;
    constexpr int kRounds = 200;
    std::vector<pid_t> kids;
    for (int p = 0; p < kProcs; ++p) {
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            VLIBSem* sem = VLIBCSemOpen(key.get());
            if (sem == nullptr) {
                _exit(2);
            }
            for (int i = 0; i < kRounds; ++i) {
                if (VLIBCSemLock(sem) != 0) {
                    _exit(3);
                }
                // Read-modify-write of a counter file: lost updates show a broken exclusion.
                FILE* f = fopen(shared_path, "r+");
                if (f == nullptr) {
                    _exit(5);
                }
                long value = 0;
                if (fscanf(f, "%ld", &value) != 1) {
                    value = 0;
                }
                rewind(f);
                fprintf(f, "%ld\n", value + 1);
                fclose(f);
                if (VLIBCSemUnlock(sem) != 0) {
                    _exit(4);
                }
            }
            VLIBCSemClose(sem);
            _exit(0);
        }
        kids.push_back(pid);
    }
    for (pid_t pid : kids) {
        int status = 0;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }
    FILE* f = fopen(shared_path, "r");
    long value = 0;
    ASSERT_EQ(fscanf(f, "%ld", &value), 1);
    fclose(f);
    EXPECT_EQ(value, kProcs * kRounds);
}

TEST(Semaphore, AHolderKilledWhileLockedReleasesIt) {
    SemKey key;
    int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        VLIBSem* sem = VLIBCSemOpen(key.get());
        if (sem == nullptr || VLIBCSemLock(sem) != 0) {
            _exit(2);
        }
        char c = 1;
        if (write(ready[1], &c, 1) != 1) {
            _exit(3);
        }
        pause();
        _exit(0);
    }
    close(ready[1]);
    char c;
    ASSERT_EQ(read(ready[0], &c, 1), 1);
    close(ready[0]);

    // While the child holds it, a second process cannot take it.
    pid_t probe = fork();
    ASSERT_GE(probe, 0);
    if (probe == 0) {
        VLIBSem* sem = VLIBCSemOpen(key.get());
        alarm(1);  // SIGALRM ends the blocked probe: proof that it was blocked
        VLIBCSemLock(sem);
        _exit(0);
    }
    int status = 0;
    ASSERT_EQ(waitpid(probe, &status, 0), probe);
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGALRM);

    kill(pid, SIGKILL);
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    VLIBSem* sem = VLIBCSemOpen(key.get());
    ASSERT_NE(sem, nullptr);
    EXPECT_EQ(VLIBCSemLock(sem), 0);
    EXPECT_EQ(VLIBCSemClose(sem), 0);
}

}  // namespace
