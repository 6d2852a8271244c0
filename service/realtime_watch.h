// RealtimeWatch: a recursive inotify watch over the folders of real-time tasks' shares. It tells
// which share of which task changed and which paths in it (relative to the share's folder: the
// entry an event names, or the folder whose own attributes changed); directories created later
// are watched as they appear, and a directory moved within the share is found under its new name.
// A path may be named that no longer exists: syncing it deletes it on the receiver. When
// the kernel's queue overflows, or a watch cannot be added (the max_user_watches limit), changes
// may go unseen: the affected shares are reported with `full` set, so the caller syncs them whole
// and logs why. A share whose folder is missing (at start, or removed or moved away later, as
// when its volume is unmounted) is not watched until Rewatch() finds the folder again.
#ifndef S2S_SERVICE_REALTIME_WATCH_H
#define S2S_SERVICE_REALTIME_WATCH_H

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <vector>

namespace s2sd {

struct WatchedShare {
    uint64_t task = 0;
    std::string share;
    std::string root;  // the share's folder
};

struct ShareChange {
    uint64_t task = 0;
    std::string share;
    bool full = false;   // sync the whole share (events may have been lost, or too many paths)
    std::string reason;  // why, for the log, when events may have been lost
    std::set<std::string> paths;  // what changed, when not `full`
};

class RealtimeWatch {
  public:
    // More changed paths than this in one read make a share's change a whole-share one.
    static constexpr size_t kMaxPaths = 10000;

    RealtimeWatch();
    ~RealtimeWatch();
    RealtimeWatch(const RealtimeWatch&) = delete;
    RealtimeWatch& operator=(const RealtimeWatch&) = delete;

    // The descriptor to poll for readability; -1 when inotify is unavailable.
    int Fd() const { return fd_; }
    // Replaces everything watched with `shares`. Shares that could not be watched whole are
    // returned as changes with `full` set.
    std::vector<ShareChange> Watch(const std::vector<WatchedShare>& shares);
    // Reads the pending events (never blocks) and returns the shares they touched, each once.
    std::vector<ShareChange> Read();
    // Directories watched now.
    size_t Count() const { return dirs_.size(); }
    // Called on the caller's periodic tick: at most every kRewatchMs it tries again to watch the
    // folders of shares that went away or were missing, and returns those it watches again as
    // changed (their content is new to the watch). Logs a NOTE for each.
    static constexpr long kRewatchMs = 10000;
    std::vector<ShareChange> Rewatch(long now_ms);
    // How long until Rewatch() should look again (0 when it is due), or -1 while every share's
    // folder is watched: the caller's wait is bounded by it, so no tick is needed otherwise.
    long NextRewatchMs(long now_ms) const;

  private:
    // Watches `dir` and every directory below it for `share`; false when a watch failed.
    // `top`, when given, receives the watch of `dir` itself (-1 when it was not there).
    bool AddTree(const std::string& dir, size_t share, std::string& reason, int* top = nullptr);
    // Watches the folder of share `i`; its root watch stays -1 (with a WARNING) when it is missing.
    bool AddRoot(size_t i, std::string& reason);
    // The root of share `i` went away: its watch is dropped until Rewatch() finds it again.
    void LoseRoot(size_t i);
    void Reset();

    int fd_ = -1;
    std::vector<WatchedShare> shares_;
    std::vector<int> root_wd_;  // per share: the watch of its folder, -1 while it is missing
    long last_rewatch_ms_ = 0;
    struct Dir {
        std::string path;
        std::vector<size_t> shares;  // indexes into shares_
    };
    std::map<int, Dir> dirs_;
};

}  // namespace s2sd

#endif  // S2S_SERVICE_REALTIME_WATCH_H
