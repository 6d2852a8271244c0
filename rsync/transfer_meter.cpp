// The size of a share's tree, and the meter that follows a running rsync through /proc.
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
#include <utility>
#include <vector>

namespace S2S {

namespace {

// rsync, its remote shell and helpers sit at most a few levels below this process.
constexpr int kMaxDepth = 4;

struct DirCloser {
    void operator()(DIR* dir) const { closedir(dir); }
};

// One directory of the walk: its identity and the subdirectories still to visit.
struct Level {
    dev_t dev = 0;
    ino_t ino = 0;
    std::vector<std::string> pending;
};

// Counts the regular files of the directory open at `fd` and notes its subdirectories.
bool ScanDir(int fd, TreeSize& size, Level& level) {
    struct stat self;
    const int dup_fd = fcntl(fd, F_DUPFD_CLOEXEC, 0);
    if (fstat(fd, &self) != 0 || dup_fd < 0) {
        if (dup_fd >= 0) {
            close(dup_fd);
        }
        return false;
    }
    level.dev = self.st_dev;
    level.ino = self.st_ino;
    // fdopendir takes over dup_fd; closedir releases it.
    std::unique_ptr<DIR, DirCloser> dir(fdopendir(dup_fd));
    if (!dir) {
        close(dup_fd);
        return false;
    }
    while (struct dirent* entry = readdir(dir.get())) {
        const char* name = entry->d_name;
        if (std::strcmp(name, ".") == 0 || std::strcmp(name, "..") == 0) {
            continue;
        }
        struct stat st;
        if (fstatat(fd, name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
            continue;
        }
        if (S_ISREG(st.st_mode)) {
            ++size.files;
            size.bytes += static_cast<uint64_t>(st.st_size);
        } else if (S_ISDIR(st.st_mode)) {
            level.pending.push_back(name);
        }
    }
    return true;
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

// The walk goes as deep as the tree does: one descriptor is open at a time (the directory being
// read), and the way back up is "..", checked against the directory it came from, so neither
// descriptors nor path lengths bound the depth. A tree changed under the walk so that ".." leads
// elsewhere ends it with what was counted so far.
TreeSize MeasureTree(const std::string& root) {
    TreeSize size;
    int fd = open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) {
        return size;
    }
    std::vector<Level> stack(1);
    if (!ScanDir(fd, size, stack.back())) {
        close(fd);
        return size;
    }
    while (!stack.empty()) {
        Level& top = stack.back();
        if (!top.pending.empty()) {
            const std::string name = top.pending.back();
            top.pending.pop_back();
            const int child =
                openat(fd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
            if (child < 0) {
                continue;
            }
            Level level;
            if (!ScanDir(child, size, level)) {
                close(child);
                continue;
            }
            close(fd);
            fd = child;
            stack.push_back(std::move(level));
            continue;
        }
        stack.pop_back();
        if (stack.empty()) {
            break;
        }
        const int parent = openat(fd, "..", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
        close(fd);
        fd = parent;
        struct stat st;
        if (fd < 0 || fstat(fd, &st) != 0 || st.st_dev != stack.back().dev ||
            st.st_ino != stack.back().ino) {
            break;
        }
    }
    if (fd >= 0) {
        close(fd);
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
