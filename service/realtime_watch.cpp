// The recursive inotify watch of real-time shares.
#include "service/realtime_watch.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <set>

namespace s2sd {

namespace {

// Everything that changes what a sync would send.
constexpr uint32_t kMask = IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB | IN_CREATE | IN_DELETE |
                           IN_MOVED_FROM | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF |
                           IN_DONT_FOLLOW | IN_EXCL_UNLINK;

}  // namespace

RealtimeWatch::RealtimeWatch() : fd_(inotify_init1(IN_NONBLOCK | IN_CLOEXEC)) {}

RealtimeWatch::~RealtimeWatch() {
    if (fd_ >= 0) {
        close(fd_);
    }
}

void RealtimeWatch::Reset() {
    for (const auto& dir : dirs_) {
        inotify_rm_watch(fd_, dir.first);
    }
    dirs_.clear();
    shares_.clear();
}

bool RealtimeWatch::AddTree(const std::string& dir, size_t share, std::string& reason) {
    const int wd = inotify_add_watch(fd_, dir.c_str(), kMask | IN_ONLYDIR);
    if (wd < 0) {
        if (errno == ENOSPC) {
            reason =
                "the limit of inotify watches is reached (raise it with sysctl "
                "fs.inotify.max_user_watches=N)";
            return false;
        }
        if (errno == ENOENT || errno == ENOTDIR) {
            return true;  // gone meanwhile: nothing left to watch there
        }
        reason = "cannot watch " + dir + ": " + std::strerror(errno);
        return false;
    }
    Dir& entry = dirs_[wd];
    entry.path = dir;
    if (std::find(entry.shares.begin(), entry.shares.end(), share) == entry.shares.end()) {
        entry.shares.push_back(share);
    }
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return true;
    }
    bool ok = true;
    while (struct dirent* item = readdir(d)) {
        const std::string name = item->d_name;
        if (name == "." || name == "..") {
            continue;
        }
        const std::string path = dir + "/" + name;
        bool is_dir = item->d_type == DT_DIR;
        if (item->d_type == DT_UNKNOWN) {
            struct stat st;
            is_dir = lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
        }
        if (is_dir && !AddTree(path, share, reason)) {
            ok = false;
            break;
        }
    }
    closedir(d);
    return ok;
}

std::vector<ShareChange> RealtimeWatch::Watch(const std::vector<WatchedShare>& shares) {
    std::vector<ShareChange> full;
    if (fd_ < 0) {
        for (const WatchedShare& share : shares) {
            full.push_back({share.task, share.share, true, "inotify is not available", {}});
        }
        return full;
    }
    Reset();
    shares_ = shares;
    for (size_t i = 0; i < shares_.size(); ++i) {
        std::string reason;
        if (!AddTree(shares_[i].root, i, reason)) {
            full.push_back({shares_[i].task, shares_[i].share, true, reason, {}});
        }
    }
    return full;
}

std::vector<ShareChange> RealtimeWatch::Read() {
    std::vector<ShareChange> changes;
    if (fd_ < 0) {
        return changes;
    }
    std::map<size_t, std::set<std::string>> touched;
    std::set<size_t> whole;
    std::set<size_t> lost;
    std::string lost_reason;
    // Records `dir` (absolute) and, when not empty, the entry `name` in it as changed in `share`.
    const auto note = [&](size_t share, const std::string& dir, const std::string& name) {
        std::set<std::string>& paths = touched[share];
        const std::string& root = shares_[share].root;
        std::string rel;
        if (dir.size() > root.size() && dir.compare(0, root.size(), root) == 0 &&
            dir[root.size()] == '/') {
            rel = dir.substr(root.size() + 1);
        } else if (dir != root) {
            whole.insert(share);  // not below the share's folder as it was named: be safe
            return;
        }
        if (!name.empty()) {
            rel = rel.empty() ? name : rel + "/" + name;
        }
        if (rel.empty() || paths.size() >= kMaxPaths) {
            whole.insert(share);  // the share's own folder, or too many to list
            return;
        }
        paths.insert(rel);
    };
    alignas(struct inotify_event) char buffer[64 * 1024];
    for (;;) {
        const ssize_t n = read(fd_, buffer, sizeof(buffer));
        if (n <= 0) {
            break;  // EAGAIN: nothing more for now
        }
        for (ssize_t pos = 0; pos < n;) {
            const struct inotify_event* event =
                reinterpret_cast<const struct inotify_event*>(buffer + pos);
            pos += static_cast<ssize_t>(sizeof(struct inotify_event) + event->len);
            if ((event->mask & IN_Q_OVERFLOW) != 0) {
                for (size_t i = 0; i < shares_.size(); ++i) {
                    lost.insert(i);
                }
                lost_reason = "the inotify event queue overflowed";
                continue;
            }
            const auto dir = dirs_.find(event->wd);
            if (dir == dirs_.end()) {
                continue;
            }
            const std::vector<size_t> owners = dir->second.shares;
            const std::string path = dir->second.path;
            const std::string name = event->len > 0 ? std::string(event->name) : std::string();
            if ((event->mask & IN_IGNORED) != 0) {
                for (size_t share : owners) {
                    note(share, path, "");
                }
                dirs_.erase(dir);
                continue;
            }
            for (size_t share : owners) {
                note(share, path, name);
            }
            // A directory that appears, or moves in, is watched with all it holds (a watched
            // directory moved within the share keeps its watches, renamed here).
            if ((event->mask & IN_ISDIR) != 0 && (event->mask & (IN_CREATE | IN_MOVED_TO)) != 0 &&
                !name.empty()) {
                for (size_t share : owners) {
                    std::string reason;
                    if (!AddTree(path + "/" + name, share, reason)) {
                        lost.insert(share);
                        lost_reason = reason;
                    }
                }
            }
        }
    }
    for (auto& item : touched) {
        if (lost.count(item.first) == 0) {
            ShareChange change{shares_[item.first].task,
                               shares_[item.first].share,
                               whole.count(item.first) != 0,
                               "",
                               {}};
            if (!change.full) {
                change.paths = std::move(item.second);
            }
            changes.push_back(std::move(change));
        }
    }
    for (size_t i : lost) {
        changes.push_back({shares_[i].task, shares_[i].share, true, lost_reason, {}});
    }
    return changes;
}

}  // namespace s2sd
