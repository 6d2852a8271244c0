// The inter-process file lock (SimpleFileLock, LockFactory): an exclusive flock on a named file,
// held by at most one process of the host at a time, released when the holder closes or dies.

#include <errno.h>
#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

namespace S2S {

namespace {

// Takes (`want`) or releases the lock on `fd` unless it is in that state already; `verb` names
// the step in the message of a failure.
int SetLocked(int fd, bool& locked, bool want, const char* verb) {
    if (locked == want) {
        return 0;
    }
    if (fd < 0) {
        return -1;
    }
    if (flock(fd, want ? LOCK_EX : LOCK_UN) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to %s, error:'%s'\n", __LINE__,
                       verb, strerror(errno));
        return -1;
    }
    locked = want;
    return 0;
}

}  // namespace

SimpleFileLock::SimpleFileLock(const std::string& path) : locked(false), fd(-1) {
    fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s.cpp(%d): Fail to open lock file at '%s', error:'%s'\n",
                       __LINE__, path.c_str(), strerror(errno));
    }
}

SimpleFileLock::~SimpleFileLock() {
    if (fd >= 0) {
        close(fd);
        fd = -1;
    }
}

SimpleFileLock::SimpleFileLock(SimpleFileLock&& other) noexcept
    : locked(other.locked), fd(other.fd) {
    other.locked = false;
    other.fd = -1;
}

SimpleFileLock& SimpleFileLock::operator=(SimpleFileLock&& other) noexcept {
    if (this != &other) {
        if (fd >= 0) {
            close(fd);
        }
        locked = other.locked;
        fd = other.fd;
        other.locked = false;
        other.fd = -1;
    }
    return *this;
}

int SimpleFileLock::ExLock() {
    return SetLocked(fd, locked, true, "lock");
}

int SimpleFileLock::UnLock() {
    return SetLocked(fd, locked, false, "unlock");
}

LockFactory::LockFactory(const std::string& path) : path(path) {}

SimpleFileLock LockFactory::GetLock() const {
    return SimpleFileLock(path);
}

}  // namespace S2S
