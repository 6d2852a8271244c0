// Directory creation, whole-file replacement (the platform's atomic one) and the instance lock
// for the daemon's files.
#include "service/files.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "s2s_platform.h"

namespace s2sd {

namespace {

std::string Why(const std::string& what, const std::string& path) {
    return what + " " + path + ": " + std::strerror(errno);
}

}  // namespace

int MakeDirs(const std::string& dir, mode_t mode, std::string& error) {
    for (size_t pos = 1; pos <= dir.size(); ++pos) {
        if (pos != dir.size() && dir[pos] != '/') {
            continue;
        }
        const std::string part = dir.substr(0, pos);
        if (mkdir(part.c_str(), mode) != 0 && errno != EEXIST) {
            error = Why("cannot create", part);
            return -1;
        }
    }
    struct stat st;
    if (stat(dir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
        error = "not a directory: " + dir;
        return -1;
    }
    return 0;
}

int ReplaceFile(const std::string& path, const std::string& content, mode_t mode,
                std::string& error) {
    if (S2SFileReplace(path.c_str(), content.data(), content.size(), mode) != 0) {
        error = Why("cannot write", path);
        return -1;
    }
    return 0;
}

bool ReadFile(const std::string& path, std::string& content) {
    const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) {
        return false;
    }
    content.clear();
    char buffer[4096];
    for (;;) {
        const ssize_t n = read(fd, buffer, sizeof(buffer));
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            close(fd);
            return n == 0;
        }
        content.append(buffer, static_cast<size_t>(n));
    }
}

int LockInstance(const std::string& path, long& holder, std::string& error) {
    holder = 0;
    const std::string dir = path.substr(0, path.rfind('/'));
    if (!dir.empty() && MakeDirs(dir, 0700, error) != 0) {
        return -1;
    }
    const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
    if (fd < 0) {
        error = Why("cannot open", path);
        return -1;
    }
    if (flock(fd, LOCK_EX | LOCK_NB) == 0) {
        return fd;
    }
    const int saved = errno;
    if (saved == EWOULDBLOCK) {
        char text[32] = {};
        const ssize_t got = pread(fd, text, sizeof(text) - 1, 0);
        if (got > 0) {
            holder = std::strtol(text, nullptr, 10);
        }
        error = "s2sd is already running (pid " +
                (holder > 0 ? std::to_string(holder) : std::string("unknown")) + ")";
        close(fd);
        return -2;
    }
    errno = saved;
    error = Why("cannot lock", path);
    close(fd);
    return -1;
}

int WriteLockPid(int fd, std::string& error) {
    const std::string text = std::to_string(static_cast<long>(getpid())) + "\n";
    if (ftruncate(fd, 0) != 0 ||
        pwrite(fd, text.data(), text.size(), 0) != static_cast<ssize_t>(text.size())) {
        error = std::string("cannot write the pid into the lock file: ") + std::strerror(errno);
        return -1;
    }
    return 0;
}

}  // namespace s2sd
