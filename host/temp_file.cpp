// Temporary files of the sending side: reserved in a private directory (root's, mode 0700) so
// content a server chose can never be written through a link someone else planted.

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

namespace S2S {

namespace {

// Output files of remote commands are written with content the server chose. Were the directory
// open to another user, that user could swap a reserved name for a symbolic link and have the
// content written wherever the link points, with this program's rights. So the directory must be
// a real directory owned by this program's user (root on a server) that nobody else can enter.
// Its parent is sticky (/tmp), so only its owner can rename or remove it once it is checked.
bool PrepareTempDir(const std::string& dir, std::string& error) {
    // Missing parents occur only below S2S_ROOT (/tmp itself always exists).
    for (size_t pos = 1; pos < dir.size(); ++pos) {
        if (dir[pos] == '/') {
            mkdir(dir.substr(0, pos).c_str(), 0755);
        }
    }
    if (mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) {
        error = "cannot create the temporary directory " + dir + ": " + strerror(errno);
        return false;
    }
    struct stat st;
    if (lstat(dir.c_str(), &st) != 0) {
        error = "cannot check the temporary directory " + dir + ": " + strerror(errno);
        return false;
    }
    const std::string me = geteuid() == 0 ? "root" : "user " + std::to_string(geteuid());
    if (!S_ISDIR(st.st_mode)) {
        error = "the temporary directory " + dir +
                " is not a directory (a link or a file stands in its place); remove it, it is "
                "created again at first use";
        return false;
    }
    if (st.st_uid != geteuid()) {
        error = "the temporary directory " + dir + " belongs to user " + std::to_string(st.st_uid) +
                ", not to " + me +
                "; refusing to use it (remove it, it is created again at first use)";
        return false;
    }
    if ((st.st_mode & 077) != 0) {
        char mode[8];
        snprintf(mode, sizeof(mode), "%04o", static_cast<unsigned>(st.st_mode & 07777));
        error = "the temporary directory " + dir + " has mode " + mode +
                "; other users must have no access to it, refusing to use it (chmod 700 " + dir +
                ")";
        return false;
    }
    return true;
}

}  // namespace

bool PrepareTempDir(std::string& error) {
    const char* dir = S2SPath(S2S_PATH_TEMP_DIR);
    if (dir == nullptr) {
        error = "out of memory";
        return false;
    }
    return PrepareTempDir(std::string(dir), error);
}

std::string GetTempFile(std::string& error) {
    const char* dir = S2SPath(S2S_PATH_TEMP_DIR);
    const char* tmpl = S2SPath(S2S_PATH_TEMP_TEMPLATE);
    if (dir == nullptr || tmpl == nullptr) {
        error = "out of memory";
        return std::string();
    }
    if (!PrepareTempDir(dir, error)) {
        return std::string();
    }
    std::string name(tmpl);
    // O_EXCL (always set by mkostemp) never follows a link; O_NOFOLLOW says so once more.
    int fd = mkostemp(&name[0], O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) {
        error = "cannot create a temporary file in " + std::string(dir) + ": " + strerror(errno);
        return std::string();
    }
    // The empty file stays: it reserves the name until PutTempFile.
    close(fd);
    return name;
}

std::string GetTempFile() {
    std::string error;
    std::string name = GetTempFile(error);
    if (name.empty()) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): %s\n", __LINE__, error.c_str());
    }
    return name;
}

void PutTempFile(const std::string& path) {
    if (path.empty()) {
        return;
    }
    if (unlink(path.c_str()) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s.cpp(%d): Fail to unlink temp file '%s' [%d]\n",
                       __LINE__, path.c_str(), errno);
    }
}

}  // namespace S2S
