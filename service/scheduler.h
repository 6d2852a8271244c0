// Scheduler: when each scheduled task runs next. It holds no threads and reads time only through
// a WallClock, so a test drives it through days and clock jumps without waiting.
//
// A task is due when its next run is not later than now. A run missed while the service was down
// is due once at start (however many were missed), and a task runs again at the first run after
// the one it just had, never to catch up. A jump of the wall clock against the monotonic clock,
// or a change of the time zone, recomputes every next run from now; a run that had fallen due
// before the jump stays due.
#ifndef S2S_SERVICE_SCHEDULER_H
#define S2S_SERVICE_SCHEDULER_H

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "s2s_sync_obj.h"

namespace s2sd {

class WallClock {
  public:
    virtual ~WallClock();
    // Seconds since the epoch.
    virtual long Now() const;
    // Seconds on a clock that never jumps.
    virtual long Monotonic() const;
    // The local time zone as it is now (its name and offset), to notice a change.
    virtual std::string Zone() const;
};

class Scheduler {
  public:
    // The difference between wall and monotonic time taken for a clock jump.
    static constexpr long kJumpSeconds = 5;

    explicit Scheduler(const WallClock& clock);

    // The next run of `schedule` strictly after `after` by the local wall clock; 0 when there is
    // none (or the schedule cannot give one).
    static long NextRunAfter(const S2S::Schedule& schedule, long after);
    // `last_scheduled`, or `now` when it is later (the store keeps the capped value).
    static long CapAtNow(long last_scheduled, long now) {
        return last_scheduled > now ? now : last_scheduled;
    }

    // Adds or replaces a task. `last_scheduled` is when its last scheduled run was due (or when
    // it was added); a later run already past is due at the next Tick. A `last_scheduled` later
    // than now (stored while the clock was ahead) counts as now, so the task is not held back
    // until that time. Manual and real-time tasks have no next run.
    void Set(uint64_t id, const S2S::Schedule& schedule, long last_scheduled);
    void Remove(uint64_t id);
    // The tasks due now, each once; their next runs move on. `due_at` receives, per task, the
    // time the run was due (for the store's reference of missed runs).
    std::vector<uint64_t> Tick(std::map<uint64_t, long>* due_at = nullptr);
    // 0 when the task has no next run.
    long NextRun(uint64_t id) const;
    // The earliest next run of all tasks; 0 when none has one.
    long Earliest() const;
    // True when the last Tick recomputed every next run.
    bool Recomputed() const { return recomputed_; }

  private:
    struct Entry {
        S2S::Schedule schedule;
        long next = 0;
    };
    bool ClockChanged();

    const WallClock& clock_;
    std::map<uint64_t, Entry> entries_;
    long last_wall_ = 0;
    long last_mono_ = 0;
    std::string zone_;
    bool recomputed_ = false;
};

}  // namespace s2sd

#endif  // S2S_SERVICE_SCHEDULER_H
