// Service: the sync service s2sd. It keeps the tasks (TaskStore), runs them on their schedules
// (Scheduler) and in real time (RealtimeWatch), at most `max_runs` at once and one run per task at
// a time, and answers the control socket (ControlServer, docs/service.md).
//
// Threads: Serve() runs the loop on the caller's thread; every run goes on a thread of its own
// and reports back through the loop. Stop() and Hangup() may be called from a signal handler.
//
// At start, runs that were due while the service was down run once; real-time tasks get one full
// run (changes made meanwhile were not seen); runs the service did not see end are recorded as
// interrupted.
#ifndef S2S_SERVICE_SERVICE_H
#define S2S_SERVICE_SERVICE_H

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "s2s_pobject.h"
#include "s2s_task_run.h"
#include "service/control_server.h"
#include "service/realtime_watch.h"
#include "service/scheduler.h"
#include "service/task_store.h"

namespace s2sd {

struct ServiceOptions {
    std::string db_path;
    std::string password_dir;
    std::string socket_path;
    unsigned max_runs = 2;
    long realtime_delay_ms = 5000;  // events of a real-time share are gathered this long
    ControlLimits control;
};

class Service {
  public:
    Service(const ServiceOptions& options, const WallClock& clock);
    ~Service();
    Service(const Service&) = delete;
    Service& operator=(const Service&) = delete;

    // Opens the store, loads the tasks and listens. 0, or -1 with `error`.
    int Start(std::string& error);
    // The loop; returns after Stop() once every run has ended (cancelled runs end within a
    // fraction of a second, their rsync stopped and their shares not marked complete).
    void Serve();
    void Stop();
    void Hangup();
    // Called on the loop's thread after Hangup().
    void SetHangupHandler(std::function<void()> handler) { on_hangup_ = std::move(handler); }

    // One control request (what the socket's connections are answered with).
    void Handle(const S2S::PObject& request, S2S::PObject& reply);

  private:
    struct TaskState;
    struct Job;
    class Observer;

    void Load(long now);
    void Wake();
    void DrainWake();
    void Tick(long now_ms);
    // Brings a stored last_scheduled later than `now` back to `now`, in memory and in the store.
    void CapLastScheduled(TaskState& state, long now);
    void ArmTimer();
    void RefreshWatch();
    void OnChanges(const std::vector<ShareChange>& changes, long now_ms);
    void Queue(uint64_t id, const Job& job, const std::string& why);
    void StartRuns();
    void RunThread(uint64_t id, S2S::SyncTask task, S2S::SourceGuardOptions guard, const Job& job,
                   const S2S::KnownServer& known, std::shared_ptr<std::atomic<bool>> cancel);
    void Reap();
    // The task `id`, or null with the reply set to no-such-task. With `busy` given, a running
    // task is refused too: null, the reply set to busy with "task <id> " and `busy`. Holds no
    // lock: call with mutex_.
    TaskState* FindTask(uint64_t id, S2S::PObject& reply, const char* busy = nullptr);
    // The prologue of the commands that name their task by a required task_id: reads the id,
    // takes mutex_ and finds the task as FindTask does. `task` is null when the reply says why;
    // otherwise the returned lock holds mutex_.
    std::unique_lock<std::mutex> LockTask(const S2S::PObject& request, S2S::PObject& reply,
                                          unsigned long long& id, TaskState*& task,
                                          const char* busy = nullptr);
    S2S::PObject TaskMap(const TaskState& state) const;
    S2S::PObject StatusMap(const TaskState& state) const;

    void CmdAdd(const S2S::PObject& request, S2S::PObject& reply);
    void CmdUpdate(const S2S::PObject& request, S2S::PObject& reply);
    void CmdRemove(const S2S::PObject& request, S2S::PObject& reply);
    void CmdList(const S2S::PObject& request, S2S::PObject& reply);
    void CmdShow(const S2S::PObject& request, S2S::PObject& reply);
    void CmdRun(const S2S::PObject& request, S2S::PObject& reply);
    void CmdCancel(const S2S::PObject& request, S2S::PObject& reply);
    void CmdStatus(const S2S::PObject& request, S2S::PObject& reply);
    void CmdHistory(const S2S::PObject& request, S2S::PObject& reply);
    void CmdPause(const S2S::PObject& request, S2S::PObject& reply, bool pause);

    ServiceOptions options_;
    const WallClock& clock_;
    TaskStore store_;
    Scheduler scheduler_;
    RealtimeWatch watch_;
    ControlServer control_;
    std::function<void()> on_hangup_;
    int wake_[2] = {-1, -1};
    // Fires at the earliest scheduled run by the wall clock, and when the wall clock is set.
    int timer_ = -1;
    long timer_at_ = -1;  // what it is armed for (epoch seconds, 0 disarmed)
    std::atomic<bool> stopping_{false};
    std::atomic<bool> hangup_{false};
    bool paused_ = false;  // the whole service
    long last_tick_ms_ = 0;

    // Guards the tasks' run state, which run threads update.
    mutable std::mutex mutex_;
    std::map<uint64_t, std::unique_ptr<TaskState>> tasks_;
    std::vector<uint64_t> queue_;
    struct Active {
        uint64_t id;
        std::thread thread;
        std::shared_ptr<std::atomic<bool>> done;
    };
    std::vector<Active> active_;
};

}  // namespace s2sd

#endif  // S2S_SERVICE_SERVICE_H
