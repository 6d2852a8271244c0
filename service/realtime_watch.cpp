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

#include "s2s_logger.h"

namespace s2sd {

using S2S::Logger;

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
    root_wd_.clear();
}

bool RealtimeWatch::AddRoot(size_t i, std::string& reason) {
    const bool ok = AddTree(shares_[i].root, i, reason, &root_wd_[i]);
    if (ok && root_wd_[i] < 0) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] realtime_watch.cpp(%d): task %llu: share '%s': its folder %s is "
                       "missing; it is watched again when it appears\n",
                       __LINE__, static_cast<unsigned long long>(shares_[i].task),
                       shares_[i].share.c_str(), shares_[i].root.c_str());
    }
    return ok;
}

void RealtimeWatch::LoseRoot(size_t i) {
    if (root_wd_[i] < 0) {
        return;
    }
    // A folder moved away keeps its watch: dropped here, so the share's path is watched afresh.
    inotify_rm_watch(fd_, root_wd_[i]);
    root_wd_[i] = -1;
    Logger::LogMsg(Logger::Warning,
                   "[WARNING] realtime_watch.cpp(%d): task %llu: share '%s': its folder %s went "
                   "away; it is watched again when it comes back\n",
                   __LINE__, static_cast<unsigned long long>(shares_[i].task),
                   shares_[i].share.c_str(), shares_[i].root.c_str());
}

long RealtimeWatch::NextRewatchMs(long now_ms) const {
    if (fd_ < 0) {
        return -1;
    }
    for (int wd : root_wd_) {
        if (wd < 0) {
            return std::max(0L, last_rewatch_ms_ + kRewatchMs - now_ms);
        }
    }
    return -1;
}

std::vector<ShareChange> RealtimeWatch::Rewatch(long now_ms) {
    std::vector<ShareChange> changes;
    if (fd_ < 0 || now_ms - last_rewatch_ms_ < kRewatchMs) {
        return changes;
    }
    last_rewatch_ms_ = now_ms;
    for (size_t i = 0; i < shares_.size(); ++i) {
        if (root_wd_[i] >= 0) {
            continue;
        }
        struct stat st;
        if (stat(shares_[i].root.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
            continue;
        }
        std::string reason;
        const bool ok = AddTree(shares_[i].root, i, reason, &root_wd_[i]);
        if (root_wd_[i] < 0) {
            continue;
        }
        Logger::LogMsg(Logger::Note,
                       "[NOTE] realtime_watch.cpp(%d): task %llu: share '%s': its folder %s is "
                       "watched again\n",
                       __LINE__, static_cast<unsigned long long>(shares_[i].task),
                       shares_[i].share.c_str(), shares_[i].root.c_str());
        // Whatever the folder holds now is synced whole.
        changes.push_back(
            {shares_[i].task, shares_[i].share, true, ok ? std::string() : reason, {}});
    }
    return changes;
}

bool RealtimeWatch::AddTree(const std::string& dir, size_t share, std::string& reason, int* top) {
    const int wd = inotify_add_watch(fd_, dir.c_str(), kMask | IN_ONLYDIR);
    if (top != nullptr) {
        *top = wd;
    }
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
    root_wd_.assign(shares_.size(), -1);
    for (size_t i = 0; i < shares_.size(); ++i) {
        std::string reason;
        if (!AddRoot(i, reason)) {
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
            const bool gone = (event->mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) != 0;
            for (size_t i = 0; gone && i < root_wd_.size(); ++i) {
                if (root_wd_[i] == event->wd) {
                    LoseRoot(i);
                }
            }
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
