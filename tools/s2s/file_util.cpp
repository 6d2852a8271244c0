// Opening a file for reading only when it is a regular file (the open never blocks on a FIFO or a
// device), and a whole-file read that stops at a size limit instead of growing without bound.
#include "tools/s2s/file_util.h"

#include <fcntl.h>

#include <cerrno>
#include <cstring>

namespace s2s_cli {

bool ReadAllBounded(int fd, size_t limit, std::string& content, std::string& error) {
    char buffer[8192];
    for (;;) {
        const ssize_t n = read(fd, buffer, sizeof(buffer));
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            error = std::string("cannot be read: ") + std::strerror(errno);
            return false;
        }
        if (n == 0) {
            return true;
        }
        content.append(buffer, static_cast<size_t>(n));
        if (content.size() > limit) {
            error = "is larger than " + std::to_string(limit / 1024) + " KiB";
            return false;
        }
    }
}

int OpenRegularFile(const std::string& path, struct stat& st, std::string& error) {
    const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
    if (fd < 0) {
        error = std::string("cannot be opened: ") + std::strerror(errno);
        return -1;
    }
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        close(fd);
        error = "is not a regular file";
        return -1;
    }
    return fd;
}

}  // namespace s2s_cli
