// The transfer meter and the tree measure of a share's copy.
#include "rsync/transfer_meter.h"

#include <sys/syscall.h>

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <fstream>
#include <memory>
#include <sstream>
#include <vector>

namespace S2S {

namespace {

// rsync, its remote shell and helpers sit at most a few levels below this process.
constexpr int kMaxDepth = 4;

struct DirCloser {
    void operator()(DIR* dir) const { closedir(dir); }
};

void MeasureDir(int dir_fd, TreeSize& size, int depth) {
    // fdopendir takes over dir_fd; closedir releases it.
    std::unique_ptr<DIR, DirCloser> dir(fdopendir(dir_fd));
    if (!dir) {
        close(dir_fd);
        return;
    }
    while (struct dirent* entry = readdir(dir.get())) {
        const char* name = entry->d_name;
        if (std::strcmp(name, ".") == 0 || std::strcmp(name, "..") == 0) {
            continue;
        }
        struct stat st;
        if (fstatat(dirfd(dir.get()), name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
            continue;
        }
        if (S_ISREG(st.st_mode)) {
            ++size.files;
            size.bytes += static_cast<uint64_t>(st.st_size);
        } else if (S_ISDIR(st.st_mode) && depth < 256) {
            const int child =
                openat(dirfd(dir.get()), name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
            if (child >= 0) {
                MeasureDir(child, size, depth + 1);
            }
        }
    }
}

// The children that thread `tid` of process `pid` started.
std::vector<pid_t> ChildrenOf(pid_t pid, pid_t tid) {
    std::vector<pid_t> children;
    char path[64];
    std::snprintf(path, sizeof(path), "/proc/%d/task/%d/children", static_cast<int>(pid),
                  static_cast<int>(tid));
    std::ifstream in(path);
    long child = 0;
    while (in >> child) {
        children.push_back(static_cast<pid_t>(child));
    }
    return children;
}

bool ReadChars(pid_t pid, uint64_t& rchar) {
    char path[64];
    std::snprintf(path, sizeof(path), "/proc/%d/io", static_cast<int>(pid));
    std::ifstream in(path);
    std::string key;
    unsigned long long value = 0;
    while (in >> key >> value) {
        if (key == "rchar:") {
            rchar = value;
            return true;
        }
    }
    return false;
}

}  // namespace

TreeSize MeasureTree(const std::string& root) {
    TreeSize size;
    const int fd = open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd >= 0) {
        MeasureDir(fd, size, 0);
    }
    return size;
}

void TransferMeter::Reset() {
    read_by_pid_.clear();
}

void TransferMeter::Poll() {
    Visit(getpid(), static_cast<pid_t>(syscall(SYS_gettid)), 0);
}

void TransferMeter::Visit(pid_t pid, pid_t tid, int depth) {
    if (depth >= kMaxDepth) {
        return;
    }
    for (pid_t child : ChildrenOf(pid, tid)) {
        uint64_t rchar = 0;
        if (ReadChars(child, rchar)) {
            uint64_t& seen = read_by_pid_[child];
            if (rchar > seen) {
                seen = rchar;
            }
        }
        Visit(child, child, depth + 1);
    }
}

uint64_t TransferMeter::Bytes() const {
    uint64_t total = 0;
    for (const auto& entry : read_by_pid_) {
        total += entry.second;
    }
    return total;
}

}  // namespace S2S
