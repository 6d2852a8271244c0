// The scheduler's bookkeeping of next runs.
#include "service/scheduler.h"

#include <time.h>

#include <cstdlib>

namespace s2sd {

WallClock::~WallClock() = default;

long WallClock::Now() const {
    return static_cast<long>(time(nullptr));
}

long WallClock::Monotonic() const {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long>(ts.tv_sec);
}

std::string WallClock::Zone() const {
    tzset();
    const time_t now = time(nullptr);
    struct tm local;
    localtime_r(&now, &local);
    return std::string(local.tm_zone != nullptr ? local.tm_zone : "") + " " +
           std::to_string(local.tm_gmtoff);
}

Scheduler::Scheduler(const WallClock& clock)
    : clock_(clock), last_wall_(clock.Now()), last_mono_(clock.Monotonic()), zone_(clock.Zone()) {}

long Scheduler::NextRunAfter(const S2S::Schedule& schedule, long after) {
    const long next = schedule.NextRunAfter(after);
    return next > after ? next : 0;
}

void Scheduler::Set(uint64_t id, const S2S::Schedule& schedule, long last_scheduled) {
    Entry entry;
    entry.schedule = schedule;
    if (schedule.GetMode() != S2S::SCHD_MODE(0) && schedule.GetMode() != S2S::SCHD_MODE(1)) {
        entry.next = NextRunAfter(schedule, CapAtNow(last_scheduled, clock_.Now()));
    }
    entries_[id] = entry;
}

void Scheduler::Remove(uint64_t id) {
    entries_.erase(id);
}

long Scheduler::NextRun(uint64_t id) const {
    const auto it = entries_.find(id);
    return it == entries_.end() ? 0 : it->second.next;
}

long Scheduler::Earliest() const {
    long earliest = 0;
    for (const auto& item : entries_) {
        if (item.second.next > 0 && (earliest == 0 || item.second.next < earliest)) {
            earliest = item.second.next;
        }
    }
    return earliest;
}

bool Scheduler::ClockChanged() {
    const long wall = clock_.Now();
    const long mono = clock_.Monotonic();
    const std::string zone = clock_.Zone();
    const long drift = (wall - last_wall_) - (mono - last_mono_);
    const bool changed = std::labs(drift) >= kJumpSeconds || zone != zone_;
    last_wall_ = wall;
    last_mono_ = mono;
    zone_ = zone;
    return changed;
}

std::vector<uint64_t> Scheduler::Tick(std::map<uint64_t, long>* due_at) {
    const long now = clock_.Now();
    recomputed_ = ClockChanged();
    std::vector<uint64_t> due;
    for (auto& item : entries_) {
        Entry& entry = item.second;
        if (entry.next > 0 && entry.next <= now) {
            due.push_back(item.first);
            if (due_at != nullptr) {
                (*due_at)[item.first] = entry.next;
            }
            entry.next = NextRunAfter(entry.schedule, now);
        } else if (recomputed_ && entry.next > 0) {
            entry.next = NextRunAfter(entry.schedule, now);
        }
    }
    return due;
}

}  // namespace s2sd
