// The fault-injecting Env of the crash tests.
#include "support/fault_env.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>

namespace s2s_test {

using s2s_platform::ReplaceStep;

void FaultEnv::FailNth(ReplaceStep step, int nth, int err) {
    fail_step_ = static_cast<int>(step);
    fail_nth_ = calls_[fail_step_] + nth;
    fail_errno_ = err;
}

bool FaultEnv::Fails(ReplaceStep step) {
    int index = static_cast<int>(step);
    if (++calls_[index] == fail_nth_ && index == fail_step_) {
        errno = fail_errno_;
        return true;
    }
    return false;
}

int FaultEnv::CreateExclusive(const std::string& path, mode_t mode) {
    return Fails(ReplaceStep::kCreate) ? -1 : Env::CreateExclusive(path, mode);
}

ssize_t FaultEnv::Write(int fd, const void* data, size_t size) {
    if (Fails(ReplaceStep::kWrite)) {
        return -1;
    }
    return Env::Write(fd, data, short_writes_ > 0 ? std::min(size, short_writes_) : size);
}

int FaultEnv::Sync(int fd) {
    return Fails(ReplaceStep::kSync) ? -1 : Env::Sync(fd);
}

int FaultEnv::Rename(const std::string& from, const std::string& to) {
    return Fails(ReplaceStep::kRename) ? -1 : Env::Rename(from, to);
}

int FaultEnv::SyncDir(const std::string& dir) {
    return Fails(ReplaceStep::kSyncDir) ? -1 : Env::SyncDir(dir);
}

struct timespec FaultEnv::WallClock() {
    struct timespec now = Env::WallClock();
    now.tv_sec += clock_ahead_.count();
    return now;
}

void FaultEnv::StepDone(ReplaceStep step) {
    if (static_cast<int>(step) == die_after_) {
        _exit(kDiedStatus);
    }
}

}  // namespace s2s_test
