// An Env for crash tests: it makes the Nth create, write, sync, rename or directory sync of a
// file replacement fail with a chosen errno, or ends the process (_exit) right after a chosen
// step of a replacement, as a power cut or a SIGKILL there would. Writes can be cut short, so a
// writer that does not finish partial writes shows, and the wall clock moved on, so what waits
// for time to pass needs no sleep. Everything else is the POSIX Env.
#ifndef S2S_TESTS_SUPPORT_FAULT_ENV_H
#define S2S_TESTS_SUPPORT_FAULT_ENV_H

#include <array>
#include <chrono>

#include "platform/env.h"

namespace s2s_test {

class FaultEnv : public s2s_platform::Env {
  public:
    // The exit status of a process that FaultEnv ended after a step.
    static constexpr int kDiedStatus = 86;

    // The `nth` call (1-based, counted from now) of the system call behind `step` fails with
    // `err`; later calls succeed again.
    void FailNth(s2s_platform::ReplaceStep step, int nth, int err);
    // The process ends with kDiedStatus as soon as `step` of a replacement has succeeded.
    void DieAfter(s2s_platform::ReplaceStep step) { die_after_ = static_cast<int>(step); }
    // Each write stores at most `bytes` (0: as many as asked).
    void ShortWrites(size_t bytes) { short_writes_ = bytes; }
    // The wall clock runs `ahead` of the real one (time passes without waiting for it).
    void ShiftClock(std::chrono::seconds ahead) { clock_ahead_ = ahead; }

    struct timespec WallClock() override;

  protected:
    int CreateExclusive(const std::string& path, mode_t mode) override;
    ssize_t Write(int fd, const void* data, size_t size) override;
    int Sync(int fd) override;
    int Rename(const std::string& from, const std::string& to) override;
    int SyncDir(const std::string& dir) override;
    void StepDone(s2s_platform::ReplaceStep step) override;

  private:
    // True (errno set) when this call of `step` is the one to fail.
    bool Fails(s2s_platform::ReplaceStep step);

    std::array<int, s2s_platform::kReplaceSteps + 1> calls_{};
    int fail_step_ = 0;
    int fail_nth_ = 0;
    int fail_errno_ = 0;
    int die_after_ = 0;
    size_t short_writes_ = 0;
    std::chrono::seconds clock_ahead_{0};
};

}  // namespace s2s_test

#endif  // S2S_TESTS_SUPPORT_FAULT_ENV_H
