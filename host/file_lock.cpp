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
    if (locked) {
        return 0;
    }
    if (fd < 0) {
        return -1;
    }
    if (flock(fd, LOCK_EX) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to lock, error:'%s'\n", __LINE__,
                       strerror(errno));
        return -1;
    }
    locked = true;
    return 0;
}

int SimpleFileLock::UnLock() {
    if (!locked) {
        return 0;
    }
    if (fd < 0) {
        return -1;
    }
    if (flock(fd, LOCK_UN) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to unlock, error:'%s'\n", __LINE__,
                       strerror(errno));
        return -1;
    }
    locked = false;
    return 0;
}

LockFactory::LockFactory(const std::string& path) : path(path) {}

SimpleFileLock LockFactory::GetLock() const {
    return SimpleFileLock(path);
}

}  // namespace S2S
