// The sync service's loop, its control commands and its runs.
#include "service/service.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

#include "s2s_control.h"
#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_receiver.h"
#include "s2s_sync_obj.h"
#include "s2s_task_run.h"

namespace s2sd {

namespace Control = S2S::Control;
using S2S::Logger;
using S2S::PObject;

namespace {

const char kPausedSetting[] = "paused";
// The busy answer of the commands that change a task: they never touch one that runs.
const char kCancelFirst[] = "is running; cancel it first";
constexpr S2S::SCHD_MODE kManual = S2S::SCHD_MODE(0);
constexpr S2S::SCHD_MODE kRealtime = S2S::SCHD_MODE(1);

enum class Kind { kString, kInteger, kStringArray };

// The keys a task map may hold and their kinds; a front end may send back what `list` gave it.
const std::map<std::string, Kind>& TaskKeys() {
    static const std::map<std::string, Kind> keys = {
        {"id", Kind::kInteger},
        {"name", Kind::kString},
        {"share_list", Kind::kStringArray},
        {"user", Kind::kString},
        {"pswd", Kind::kString},
        {"server_ip", Kind::kString},
        {"server_name", Kind::kString},
        {"compress", Kind::kInteger},
        {"block", Kind::kInteger},
        {"ssh", Kind::kInteger},
        {"ssh_port", Kind::kInteger},
        {"max_bandwidth", Kind::kInteger},
        {"schedule_mode", Kind::kInteger},
        {"schedule_begin_year", Kind::kInteger},
        {"schedule_begin_month", Kind::kInteger},
        {"schedule_begin_day", Kind::kInteger},
        {"schedule_begin_hour", Kind::kInteger},
        {"schedule_begin_min", Kind::kInteger},
        {"week_schd", Kind::kString},
        {"period_hour", Kind::kInteger},
        {"period_minute", Kind::kInteger},
        {"repeat_times_in_day", Kind::kInteger},
        {"status", Kind::kInteger},
        {"sync_result", Kind::kInteger},
        {Control::kKeyAllowEmptySource, Kind::kInteger},
        {Control::kKeyMaxDelete, Kind::kString},
        {Control::kKeyNextRun, Kind::kInteger},
        {Control::kKeyState, Kind::kString},
        {Control::kKeyTaskId, Kind::kInteger},
    };
    return keys;
}

void SetStatus(PObject& reply, Control::Status status, const std::string& message) {
    reply[Control::kKeyStatus] = static_cast<unsigned long long>(status);
    reply[Control::kKeyMessage] = message;
}

// The first key of `task` that is unknown or of the wrong kind; empty when there is none.
std::string CheckTaskMap(const PObject& task) {
    for (const auto& entry : task.asMap()) {
        const auto known = TaskKeys().find(entry.first);
        if (known == TaskKeys().end()) {
            return "unknown task key '" + entry.first + "'";
        }
        const PObject& value = entry.second;
        bool ok = false;
        switch (known->second) {
            case Kind::kString:
                ok = value.isString();
                break;
            case Kind::kInteger:
                ok = value.isInteger();
                break;
            case Kind::kStringArray:
                ok = value.isArray();
                for (const PObject& item : value.asArray()) {
                    ok = ok && item.isString();
                }
                break;
        }
        if (!ok) {
            return "task key '" + entry.first + "' has the wrong type";
        }
    }
    return "";
}

// The first rule a task breaks, for a person; Validate() logs the exact rule as well.
std::string InvalidTaskMessage(const S2S::TaskInfo& info) {
    const S2S::SyncInfo& sync = info.GetSyncInfo();
    if (sync.GetServerIP().empty() && sync.GetServerName().empty()) {
        return "the task names no server (server_ip or server_name)";
    }
    if (sync.GetUser().empty()) {
        return "the task names no user";
    }
    if (sync.GetSSHPort() > 65535) {
        return "the SSH port is out of range";
    }
    if (!info.GetSchedule().Validate()) {
        return "the schedule is invalid (the service's log names the rule)";
    }
    if (info.GetName().empty()) {
        return "the task has no name";
    }
    if (info.GetShareList().empty()) {
        return "the task names no share";
    }
    for (const std::string& share : info.GetShareList()) {
        bool valid = false;
        if (S2S::IsValidShare(share, valid) < 0 || !valid) {
            return "share '" + share + "' is not valid";
        }
    }
    return "the task is invalid (the service's log names the rule)";
}

// Reads an optional integer key: false (with the reply set) when it has the wrong type.
bool OptionalInteger(const PObject& request, const char* key, bool& present,
                     unsigned long long& value, PObject& reply) {
    present = request.hasMember(key);
    if (!present) {
        return true;
    }
    if (!request[key].isInteger()) {
        SetStatus(reply, Control::kBadRequest, std::string("'") + key + "' must be an integer");
        return false;
    }
    value = request[key].asUInt64();
    return true;
}

bool RequiredInteger(const PObject& request, const char* key, unsigned long long& value,
                     PObject& reply) {
    bool present = false;
    if (!OptionalInteger(request, key, present, value, reply)) {
        return false;
    }
    if (!present) {
        SetStatus(reply, Control::kBadRequest, std::string("'") + key + "' is missing");
    }
    return present;
}

// How long a task's next run may take the server and pairing of its last run as known: a
// real-time task that runs every few seconds is spared the server test and the pairing, a task
// that runs now and then is not.
constexpr long kKnownServerMs = 60 * 1000;
// The loop sleeps until something happens, at most this long.
constexpr long kZoneCheckMs = 60 * 1000;

}  // namespace

// A run's wish: every share of the task whole, or some of its shares, each whole or limited to
// the paths that changed in it.
struct Service::Job {
    bool all = false;
    std::map<std::string, std::set<std::string>> shares;  // an empty set: the whole share

    static Job All() {
        Job job;
        job.all = true;
        return job;
    }
    // `paths` empty: the whole share.
    void Add(const std::string& share, const std::set<std::string>& paths) {
        if (all) {
            return;
        }
        const auto it = shares.find(share);
        if (it == shares.end()) {
            shares[share] = paths;
        } else if (it->second.empty() || paths.empty()) {
            it->second.clear();
        } else {
            it->second.insert(paths.begin(), paths.end());
            if (it->second.size() > RealtimeWatch::kMaxPaths) {
                it->second.clear();
            }
        }
    }
    void Merge(const Job& more) {
        if (more.all) {
            all = true;
            shares.clear();
        }
        for (const auto& item : more.shares) {
            Add(item.first, item.second);
        }
    }
    // For the log: "all shares", or "docs (3 changed paths), photos".
    std::string Describe() const {
        if (all) {
            return "all shares";
        }
        std::string text;
        for (const auto& item : shares) {
            text += (text.empty() ? "" : ", ") + item.first;
            if (!item.second.empty()) {
                text += " (" + std::to_string(item.second.size()) + " changed path" +
                        (item.second.size() == 1 ? ")" : "s)");
            }
        }
        return text;
    }
};

struct Service::TaskState {
    StoredTask stored;
    bool queued = false;
    Job queued_job;
    bool running = false;
    bool again = false;  // a run is wanted as soon as the running one ends
    Job again_job;
    std::shared_ptr<std::atomic<bool>> cancel;
    std::string share;  // being copied now
    uint64_t bytes_done = 0;
    uint64_t bytes_total = 0;
    bool has_result = false;
    int last_result = 0;
    std::string last_message;
    // Real-time changes gathered until `pending_ms`.
    Job pending;
    long pending_ms = 0;
    // The server and pairing of the last run, when it vouched for them, and when it ended.
    S2S::KnownServer known;
    long known_ms = 0;
};

// Reports a run's progress into its task's state and the log; stops it when asked.
class Service::Observer : public S2S::TaskRunObserver {
  public:
    Observer(Service& service, uint64_t id, std::shared_ptr<std::atomic<bool>> cancel)
        : service_(service), id_(id), cancel_(std::move(cancel)) {}

    void OnMessage(const std::string& line) override {
        Logger::LogMsg(Logger::Info, "[INFO] service.cpp(%d): task %llu: %s\n", __LINE__,
                       static_cast<unsigned long long>(id_), line.c_str());
    }
    void OnError(const std::string& message) override {
        Logger::LogMsg(Logger::Warning, "[WARNING] service.cpp(%d): task %llu: %s\n", __LINE__,
                       static_cast<unsigned long long>(id_), message.c_str());
    }
    void OnCopyStart(const S2S::ShareOutcome& share) override {
        Progress(share.name, 0, share.bytes);
    }
    void OnCopyProgress(const S2S::ShareOutcome& share, uint64_t done) override {
        Progress(share.name, done, share.bytes);
    }
    void OnCopyEnd(const S2S::ShareOutcome& share) override {
        Progress("", share.bytes, share.bytes);
    }
    bool IsCancelled() override { return cancel_->load(); }
    std::string CancelReason() const override {
        return service_.stopping_ ? "the service stopping" : "a cancel request";
    }

  private:
    void Progress(const std::string& share, uint64_t done, uint64_t total) {
        std::lock_guard<std::mutex> lock(service_.mutex_);
        const auto it = service_.tasks_.find(id_);
        if (it != service_.tasks_.end()) {
            it->second->share = share;
            it->second->bytes_done = done;
            it->second->bytes_total = total;
        }
    }

    Service& service_;
    uint64_t id_;
    std::shared_ptr<std::atomic<bool>> cancel_;
};

Service::Service(const ServiceOptions& options, const WallClock& clock)
    : options_(options),
      clock_(clock),
      scheduler_(clock),
      control_(options.control,
               [this](const PObject& request, PObject& reply) { Handle(request, reply); }) {}

Service::~Service() {
    stopping_ = true;
    for (Active& run : active_) {
        if (run.thread.joinable()) {
            run.thread.join();
        }
    }
    for (int fd : wake_) {
        if (fd >= 0) {
            close(fd);
        }
    }
    if (timer_ >= 0) {
        close(timer_);
    }
}

int Service::Start(std::string& error) {
    if (pipe2(wake_, O_NONBLOCK | O_CLOEXEC) != 0) {
        error = std::string("pipe: ") + std::strerror(errno);
        return -1;
    }
    timer_ = timerfd_create(CLOCK_REALTIME, TFD_NONBLOCK | TFD_CLOEXEC);
    if (timer_ < 0) {
        error = std::string("timerfd: ") + std::strerror(errno);
        return -1;
    }
    if (store_.Open(options_.db_path, options_.password_dir, error) != 0) {
        return -1;
    }
    const long now = clock_.Now();
    if (store_.CloseInterruptedRuns(now, error) != 0) {
        return -1;
    }
    std::string paused;
    std::string ignored;
    paused_ = store_.GetSetting(kPausedSetting, paused, ignored) == 0 && paused == "1";
    std::vector<StoredTask> tasks;
    if (store_.Load(tasks, error) != 0) {
        return -1;
    }
    for (const StoredTask& stored : tasks) {
        std::unique_ptr<TaskState> state(new TaskState);
        state->stored = stored;
        // The last result shows in the status across restarts.
        std::vector<RunRecord> last;
        if (store_.History(stored.task.GetID(), 1, last, error) == 0 && !last.empty()) {
            state->has_result = true;
            state->last_result = last[0].result;
            state->last_message = last[0].message;
        }
        const S2S::Schedule& schedule = stored.task.GetInfo().GetSchedule();
        CapLastScheduled(*state, now);
        scheduler_.Set(stored.task.GetID(), schedule, state->stored.last_scheduled);
        tasks_[stored.task.GetID()] = std::move(state);
        // Changes made while the service was down were not seen: one full run.
        if (schedule.GetMode() == kRealtime && !stored.paused) {
            Queue(stored.task.GetID(), Job::All(), "real-time task at start");
        }
    }
    RefreshWatch();
    if (control_.Listen(options_.socket_path, error) != 0) {
        return -1;
    }
    Logger::LogMsg(Logger::Note,
                   "[NOTE] service.cpp(%d): s2sd serving %zu tasks on %s (at most %u runs at "
                   "once%s)\n",
                   __LINE__, tasks_.size(), options_.socket_path.c_str(), options_.max_runs,
                   paused_ ? ", paused" : "");
    return 0;
}

void Service::Wake() {
    if (wake_[1] >= 0) {
        const char byte = 1;
        // A full pipe already holds a wake-up.
        ssize_t ignored = write(wake_[1], &byte, 1);
        (void)ignored;
    }
}

void Service::DrainWake() {
    char buffer[256];
    while (read(wake_[0], buffer, sizeof(buffer)) > 0) {
    }
}

void Service::Stop() {
    stopping_ = true;
    Wake();
}

void Service::Hangup() {
    hangup_ = true;
    Wake();
}

void Service::RefreshWatch() {
    std::vector<WatchedShare> shares;
    for (const auto& item : tasks_) {
        const StoredTask& stored = item.second->stored;
        if (stored.task.GetInfo().GetSchedule().GetMode() != kRealtime || stored.paused) {
            continue;
        }
        for (const std::string& name : stored.task.GetInfo().GetShareList()) {
            S2S::ShareInfo info;
            if (S2S::GetShareInfo(name, info) != 0) {
                Logger::LogMsg(Logger::Warning,
                               "[WARNING] service.cpp(%d): task %llu: share '%s' cannot be "
                               "watched: it is not registered\n",
                               __LINE__, static_cast<unsigned long long>(item.first), name.c_str());
                continue;
            }
            shares.push_back({item.first, name, info.GetModulePath()});
        }
    }
    OnChanges(watch_.Watch(shares), NowMs());
    Logger::LogMsg(Logger::Info, "[INFO] service.cpp(%d): watching %zu folders of %zu shares\n",
                   __LINE__, watch_.Count(), shares.size());
}

void Service::OnChanges(const std::vector<ShareChange>& changes, long now_ms) {
    std::lock_guard<std::mutex> lock(mutex_);
    for (const ShareChange& change : changes) {
        const auto it = tasks_.find(change.task);
        if (it == tasks_.end()) {
            continue;
        }
        TaskState& state = *it->second;
        if (change.full && !change.reason.empty()) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] service.cpp(%d): task %llu: share '%s': %s; syncing the "
                           "whole share\n",
                           __LINE__, static_cast<unsigned long long>(change.task),
                           change.share.c_str(), change.reason.c_str());
        }
        state.pending.Add(change.share, change.full ? std::set<std::string>() : change.paths);
        if (state.pending_ms == 0) {
            state.pending_ms = now_ms + options_.realtime_delay_ms;
        }
    }
}

void Service::Queue(uint64_t id, const Job& job, const std::string& why) {
    // Callers hold mutex_ or run before any run thread exists.
    const auto it = tasks_.find(id);
    if (it == tasks_.end()) {
        return;
    }
    TaskState& state = *it->second;
    if (state.running) {
        state.again = true;
        state.again_job.Merge(job);
        return;
    }
    state.queued_job.Merge(job);
    if (!state.queued) {
        state.queued = true;
        queue_.push_back(id);
        Logger::LogMsg(Logger::Info, "[INFO] service.cpp(%d): task %llu queued (%s): %s\n",
                       __LINE__, static_cast<unsigned long long>(id), why.c_str(),
                       state.queued_job.Describe().c_str());
    }
}

void Service::StartRuns() {
    std::lock_guard<std::mutex> lock(mutex_);
    while (!paused_ && !stopping_ && active_.size() < options_.max_runs && !queue_.empty()) {
        const uint64_t id = queue_.front();
        queue_.erase(queue_.begin());
        const auto it = tasks_.find(id);
        if (it == tasks_.end() || !it->second->queued) {
            continue;
        }
        TaskState& state = *it->second;
        state.queued = false;
        state.running = true;
        state.share.clear();
        state.bytes_done = 0;
        state.bytes_total = 0;
        state.cancel = std::make_shared<std::atomic<bool>>(false);
        const Job job = state.queued_job;
        state.queued_job = Job();
        const S2S::KnownServer known =
            NowMs() - state.known_ms <= kKnownServerMs ? state.known : S2S::KnownServer();
        Active run;
        run.id = id;
        run.done = std::make_shared<std::atomic<bool>>(false);
        std::shared_ptr<std::atomic<bool>> done = run.done;
        run.thread = std::thread([this, id, task = state.stored.task, guard = state.stored.guard,
                                  job, known, cancel = state.cancel, done]() {
            RunThread(id, task, guard, job, known, cancel);
            done->store(true);
            Wake();
        });
        active_.push_back(std::move(run));
    }
}

void Service::RunThread(uint64_t id, S2S::SyncTask task, S2S::SourceGuardOptions guard,
                        const Job& job, const S2S::KnownServer& known,
                        std::shared_ptr<std::atomic<bool>> cancel) {
    std::string error;
    RunRecord record;
    record.task_id = id;
    record.start = clock_.Now();
    // Why the run's history could not be written (a full disk, say): the status says so.
    std::string history_error;
    if (store_.BeginRun(id, record.start, record.id, error) != 0) {
        history_error = error;
        Logger::LogMsg(Logger::Error, "[ERROR] service.cpp(%d): task %llu: %s\n", __LINE__,
                       static_cast<unsigned long long>(id), error.c_str());
    }
    S2S::TaskInfo info = task.GetInfo();
    std::map<std::string, std::vector<std::string>> changed;
    if (!job.all) {
        std::list<std::string> chosen;
        for (const std::string& name : info.GetShareList()) {
            const auto wish = job.shares.find(name);
            if (wish != job.shares.end()) {
                chosen.push_back(name);
                if (!wish->second.empty()) {
                    changed[name].assign(wish->second.begin(), wish->second.end());
                }
            }
        }
        info.SetShareList(chosen);
    }
    std::string password;
    S2S::RunFailure failure = S2S::RunFailure::kLocal;
    Observer observer(*this, id, cancel);
    S2S::TaskRun run(&observer);
    // Every run checks each share's source, so a scheduled, a real-time and the first run after
    // start alike never mirror an empty or unmounted folder over the receiver's copy.
    run.SetGuardOptions(guard);
    // A real-time run sends only what changed, to the server its task's last run settled on.
    run.SetChangedPaths(changed);
    run.SetKnownServer(known);
    if (store_.Password(id, password, error) != 0) {
        record.message = error;
    } else {
        S2S::SyncInfo sync = info.GetSyncInfo();
        sync.SetPassword(password);
        info.SetSyncInfo(sync);
        std::fill(password.begin(), password.end(), '\0');
        task.SetInfo(info);
        failure = run.Run(task);
        record.message = run.Message();
        for (const S2S::ShareOutcome& share : run.Shares()) {
            ShareRecord out;
            out.name = share.name;
            out.result = share.result;
            out.files = share.files;
            out.bytes = share.bytes;
            out.read_bytes = share.read_bytes;
            out.message = share.message.empty() ? S2S::ShareStateName(share.state) : share.message;
            out.guard = share.guard;
            out.would_delete = share.would_delete;
            record.shares.push_back(out);
        }
    }
    record.result = static_cast<int>(failure);
    record.end = clock_.Now();
    if (failure == S2S::RunFailure::kNone) {
        Logger::LogMsg(Logger::Note, "[NOTE] service.cpp(%d): task %llu: run done\n", __LINE__,
                       static_cast<unsigned long long>(id));
    } else {
        Logger::LogMsg(Logger::Warning, "[WARNING] service.cpp(%d): task %llu: run failed: %s\n",
                       __LINE__, static_cast<unsigned long long>(id), record.message.c_str());
    }
    if (record.id != 0 && store_.EndRun(record, error) != 0) {
        history_error = error;
        Logger::LogMsg(Logger::Error, "[ERROR] service.cpp(%d): task %llu: %s\n", __LINE__,
                       static_cast<unsigned long long>(id), error.c_str());
    }
    std::lock_guard<std::mutex> lock(mutex_);
    const auto it = tasks_.find(id);
    if (it != tasks_.end()) {
        it->second->known = run.LearntServer();
        it->second->known_ms = NowMs();
        it->second->has_result = true;
        it->second->last_result = record.result;
        it->second->last_message =
            history_error.empty() ? record.message : "history not recorded: " + history_error;
    }
}

void Service::Reap() {
    std::lock_guard<std::mutex> lock(mutex_);
    for (size_t i = 0; i < active_.size();) {
        if (!active_[i].done->load()) {
            ++i;
            continue;
        }
        active_[i].thread.join();
        const uint64_t id = active_[i].id;
        active_.erase(active_.begin() + static_cast<long>(i));
        const auto it = tasks_.find(id);
        if (it == tasks_.end()) {
            continue;
        }
        TaskState& state = *it->second;
        state.running = false;
        state.share.clear();
        if (state.again && !stopping_) {
            state.again = false;
            const Job job = state.again_job;
            state.again_job = Job();
            Queue(id, job, "changes during the last run");
        }
    }
}

void Service::CapLastScheduled(TaskState& state, long now) {
    const long capped = Scheduler::CapAtNow(state.stored.last_scheduled, now);
    if (capped == state.stored.last_scheduled) {
        return;
    }
    const uint64_t id = state.stored.task.GetID();
    Logger::LogMsg(Logger::Warning,
                   "[WARNING] service.cpp(%d): task %llu: its last scheduled run is recorded %ld "
                   "seconds in the future (the clock was ahead): counted from now\n",
                   __LINE__, static_cast<unsigned long long>(id),
                   state.stored.last_scheduled - now);
    state.stored.last_scheduled = capped;
    std::string error;
    if (store_.SetLastScheduled(id, capped, error) < 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] service.cpp(%d): task %llu: %s\n", __LINE__,
                       static_cast<unsigned long long>(id), error.c_str());
    }
}

void Service::Tick(long now_ms) {
    // Real-time shares whose folder went away are watched again once it is back.
    OnChanges(watch_.Rewatch(now_ms), now_ms);
    std::map<uint64_t, long> due_at;
    const std::vector<uint64_t> due = scheduler_.Tick(&due_at);
    if (scheduler_.Recomputed()) {
        Logger::LogMsg(Logger::Note,
                       "[NOTE] service.cpp(%d): the clock or the time zone changed: next runs "
                       "recomputed\n",
                       __LINE__);
    }
    std::lock_guard<std::mutex> lock(mutex_);
    if (scheduler_.Recomputed()) {
        // After the clock was set back, a stored time ahead of now would hold the task back at
        // the next start.
        const long now = clock_.Now();
        for (auto& item : tasks_) {
            CapLastScheduled(*item.second, now);
        }
    }
    for (uint64_t id : due) {
        std::string error;
        if (store_.SetLastScheduled(id, due_at[id], error) < 0) {
            Logger::LogMsg(Logger::Error, "[ERROR] service.cpp(%d): %s\n", __LINE__, error.c_str());
        }
        const auto it = tasks_.find(id);
        if (it == tasks_.end() || it->second->stored.paused) {
            continue;
        }
        it->second->stored.last_scheduled = due_at[id];
        Queue(id, Job::All(), "scheduled");
    }
    for (auto& item : tasks_) {
        TaskState& state = *item.second;
        if (state.pending_ms != 0 && state.pending_ms <= now_ms) {
            const Job job = state.pending;
            state.pending = Job();
            state.pending_ms = 0;
            Queue(item.first, job, "changes");
        }
    }
}

void Service::ArmTimer() {
    const long at = scheduler_.Earliest();
    if (at == timer_at_) {
        return;
    }
    struct itimerspec when = {};
    when.it_value.tv_sec = at;  // 0 disarms; a time already past fires at once
    // Setting the clock also ends the wait, so a jump is noticed without polling for it.
    if (timerfd_settime(timer_, TFD_TIMER_ABSTIME | TFD_TIMER_CANCEL_ON_SET, &when, nullptr) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] service.cpp(%d): timerfd_settime: %s\n", __LINE__,
                       std::strerror(errno));
        timer_at_ = -1;
        return;
    }
    timer_at_ = at;
}

void Service::Serve() {
    bool cancelled = false;
    while (true) {
        if (stopping_ && !cancelled) {
            cancelled = true;
            control_.Close();
            std::lock_guard<std::mutex> lock(mutex_);
            for (auto& item : tasks_) {
                if (item.second->cancel) {
                    item.second->cancel->store(true);
                }
            }
            Logger::LogMsg(Logger::Note,
                           "[NOTE] service.cpp(%d): stopping: %zu runs are being cancelled\n",
                           __LINE__, active_.size());
        }
        if (hangup_.exchange(false) && on_hangup_) {
            on_hangup_();
        }
        Reap();
        {
            std::lock_guard<std::mutex> lock(mutex_);
            if (cancelled && active_.empty()) {
                break;
            }
        }
        const long now_ms = NowMs();
        if (!stopping_) {
            // Cheap: due runs, a jump of the clock, a new time zone, real-time deadlines.
            last_tick_ms_ = now_ms;
            Tick(now_ms);
            ArmTimer();
        }
        StartRuns();

        std::vector<pollfd> fds;
        fds.push_back({wake_[0], POLLIN, 0});
        if (watch_.Fd() >= 0) {
            fds.push_back({watch_.Fd(), POLLIN, 0});
        }
        control_.AddPollFds(fds);
        fds.push_back({timer_, POLLIN, 0});
        // Nothing else wakes the loop when the time zone changes: a look once a minute.
        long wait = kZoneCheckMs - (NowMs() - last_tick_ms_);
        const long client_wait = control_.NextDeadline(now_ms);
        if (client_wait >= 0) {
            wait = std::min(wait, client_wait);
        }
        const long rewatch_wait = watch_.NextRewatchMs(now_ms);
        if (rewatch_wait >= 0) {
            wait = std::min(wait, rewatch_wait);
        }
        {
            std::lock_guard<std::mutex> lock(mutex_);
            for (const auto& item : tasks_) {
                if (item.second->pending_ms != 0) {
                    wait = std::min(wait, item.second->pending_ms - now_ms);
                }
            }
        }
        const int ready = poll(fds.data(), fds.size(), static_cast<int>(std::max(0L, wait)));
        if (ready < 0 && errno != EINTR) {
            Logger::LogMsg(Logger::Error, "[ERROR] service.cpp(%d): poll: %s\n", __LINE__,
                           std::strerror(errno));
        }
        DrainWake();
        uint64_t expirations = 0;
        // Fired, or cancelled by a setting of the clock (ECANCELED): either way it is re-armed.
        if (read(timer_, &expirations, sizeof(expirations)) < 0 && errno == ECANCELED) {
            timer_at_ = -1;
        }
        if (watch_.Fd() >= 0) {
            OnChanges(watch_.Read(), NowMs());
        }
        control_.Process(fds, NowMs());
    }
    Logger::LogMsg(Logger::Note, "[NOTE] service.cpp(%d): stopped\n", __LINE__);
}

// --- control commands ------------------------------------------------------------------------

void Service::Handle(const PObject& request, PObject& reply) {
    reply = PObject();
    if (!request.isMap()) {
        SetStatus(reply, Control::kBadRequest, "the request is not a map");
        return;
    }
    if (!request[Control::kKeyCommand].isString()) {
        SetStatus(reply, Control::kBadRequest, "the request has no string 'command'");
        return;
    }
    const std::string command = request[Control::kKeyCommand].asString();
    SetStatus(reply, Control::kOk, "");
    if (command == Control::kAdd) {
        CmdAdd(request, reply);
    } else if (command == Control::kUpdate) {
        CmdUpdate(request, reply);
    } else if (command == Control::kRemove) {
        CmdRemove(request, reply);
    } else if (command == Control::kList) {
        CmdList(request, reply);
    } else if (command == Control::kShow) {
        CmdShow(request, reply);
    } else if (command == Control::kRun) {
        CmdRun(request, reply);
    } else if (command == Control::kCancel) {
        CmdCancel(request, reply);
    } else if (command == Control::kStatus) {
        CmdStatus(request, reply);
    } else if (command == Control::kHistory) {
        CmdHistory(request, reply);
    } else if (command == Control::kPause || command == Control::kResume) {
        CmdPause(request, reply, command == Control::kPause);
    } else {
        SetStatus(reply, Control::kBadRequest, "unknown command '" + command + "'");
    }
    if (reply[Control::kKeyStatus].asUInt64() == Control::kOk) {
        Wake();
    }
}

namespace {

// The guard options a task map gives, written over `guard`: a key that is absent leaves its
// option as it is; "max_delete" "" means no limit. false with the reply set.
bool ReadGuardOptions(const PObject& map, S2S::SourceGuardOptions& guard, PObject& reply) {
    if (map.hasMember(Control::kKeyAllowEmptySource)) {
        const unsigned long long allow = map[Control::kKeyAllowEmptySource].asUInt64();
        if (allow > 1) {
            SetStatus(reply, Control::kInvalidTask,
                      "allow_empty_source must be true or false (1 or 0)");
            return false;
        }
        guard.allowEmptySource = allow == 1;
    }
    if (map.hasMember(Control::kKeyMaxDelete)) {
        const std::string text = map[Control::kKeyMaxDelete].asString();
        S2S::DeleteLimit limit;
        std::string error;
        if (!text.empty() && !S2S::DeleteLimit::Parse(text, limit, error)) {
            SetStatus(reply, Control::kInvalidTask, "max_delete: " + error);
            return false;
        }
        guard.maxDelete = limit;
    }
    return true;
}

// Reads the task and password of an add or update request; false with the reply set.
bool ReadTask(const PObject& request, S2S::SyncTask& task, bool& has_password,
              std::string& password, PObject& reply) {
    if (!request[Control::kKeyTask].isMap()) {
        SetStatus(reply, Control::kBadRequest, "'task' must be a task map");
        return false;
    }
    const PObject& map = request[Control::kKeyTask];
    const std::string problem = CheckTaskMap(map);
    if (!problem.empty()) {
        SetStatus(reply, Control::kBadRequest, problem);
        return false;
    }
    has_password = request.hasMember(Control::kKeyPassword);
    if (has_password && !request[Control::kKeyPassword].isString()) {
        SetStatus(reply, Control::kBadRequest, "'password' must be a string");
        return false;
    }
    password = request[Control::kKeyPassword].asString();
    if (!has_password && map.hasMember("pswd")) {
        has_password = true;
        password = map["pswd"].asString();
    }
    S2S::PObj2SyncTask(map, task);
    S2S::TaskInfo info = task.GetInfo();
    S2S::SyncInfo sync = info.GetSyncInfo();
    sync.SetPassword("");
    info.SetSyncInfo(sync);
    task.SetInfo(info);
    if (!task.GetInfo().Validate()) {
        SetStatus(reply, Control::kInvalidTask, InvalidTaskMessage(task.GetInfo()));
        return false;
    }
    // The receiver records every run under the task's name: a name it refuses fails each run.
    if (!S2S::ReceiverTaskNameValid(task.GetInfo().GetName())) {
        SetStatus(reply, Control::kInvalidTask, S2S::kReceiverTaskNameRule);
        return false;
    }
    return true;
}

}  // namespace

void Service::CmdAdd(const PObject& request, PObject& reply) {
    S2S::SyncTask task;
    bool has_password = false;
    std::string password;
    S2S::SourceGuardOptions guard;
    if (!ReadTask(request, task, has_password, password, reply) ||
        !ReadGuardOptions(request[Control::kKeyTask], guard, reply)) {
        return;
    }
    std::string error;
    const long now = clock_.Now();
    const int rc = store_.Add(task, guard, password, now, error);
    std::fill(password.begin(), password.end(), '\0');
    if (rc != 0) {
        SetStatus(reply, Control::kInternal, error);
        return;
    }
    const uint64_t id = task.GetID();
    const bool realtime = task.GetInfo().GetSchedule().GetMode() == kRealtime;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        std::unique_ptr<TaskState> state(new TaskState);
        state->stored.task = task;
        state->stored.guard = guard;
        state->stored.last_scheduled = now;
        tasks_[id] = std::move(state);
        scheduler_.Set(id, task.GetInfo().GetSchedule(), now);
        if (realtime) {
            Queue(id, Job::All(), "new real-time task");
        }
    }
    if (realtime) {
        RefreshWatch();
    }
    Logger::LogMsg(Logger::Note, "[NOTE] service.cpp(%d): task %llu \"%s\" added\n", __LINE__,
                   static_cast<unsigned long long>(id), task.GetInfo().GetName().c_str());
    reply[Control::kKeyTaskId] = static_cast<unsigned long long>(id);
}

void Service::CmdUpdate(const PObject& request, PObject& reply) {
    unsigned long long id = 0;
    bool present = false;
    if (!OptionalInteger(request, Control::kKeyTaskId, present, id, reply)) {
        return;
    }
    if (!present) {
        const PObject& map = request[Control::kKeyTask];
        if (!map.isMap() || !map["id"].isInteger()) {
            SetStatus(reply, Control::kBadRequest, "'task_id' is missing");
            return;
        }
        id = map["id"].asUInt64();
    }
    S2S::SyncTask task;
    bool has_password = false;
    std::string password;
    if (!ReadTask(request, task, has_password, password, reply)) {
        return;
    }
    task.SetID(id);
    bool realtime_change = false;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        TaskState* found = FindTask(id, reply, kCancelFirst);
        if (found == nullptr) {
            return;
        }
        // Guard options the map leaves out stay as they are.
        S2S::SourceGuardOptions guard = found->stored.guard;
        if (!ReadGuardOptions(request[Control::kKeyTask], guard, reply)) {
            return;
        }
        std::string error;
        const int rc = store_.Update(task, guard, has_password ? &password : nullptr, error);
        const long now = clock_.Now();
        if (rc == 0) {
            store_.SetLastScheduled(id, now, error);
        }
        std::fill(password.begin(), password.end(), '\0');
        if (rc != 0) {
            SetStatus(reply, rc == 1 ? Control::kNoSuchTask : Control::kInternal,
                      rc == 1 ? "no task " + std::to_string(id) : error);
            return;
        }
        TaskState& state = *found;
        realtime_change = state.stored.task.GetInfo().GetSchedule().GetMode() == kRealtime ||
                          task.GetInfo().GetSchedule().GetMode() == kRealtime;
        state.stored.task = task;
        state.stored.guard = guard;
        state.stored.last_scheduled = now;
        state.known = S2S::KnownServer();  // the server or the password may have changed
        scheduler_.Set(id, task.GetInfo().GetSchedule(), now);
    }
    if (realtime_change) {
        RefreshWatch();
    }
    reply[Control::kKeyTaskId] = id;
}

Service::TaskState* Service::FindTask(uint64_t id, PObject& reply, const char* busy) {
    const auto it = tasks_.find(id);
    if (it == tasks_.end()) {
        SetStatus(reply, Control::kNoSuchTask, "no task " + std::to_string(id));
        return nullptr;
    }
    if (busy != nullptr && it->second->running) {
        SetStatus(reply, Control::kBusy, "task " + std::to_string(id) + " " + busy);
        return nullptr;
    }
    return it->second.get();
}

std::unique_lock<std::mutex> Service::LockTask(const PObject& request, PObject& reply,
                                               unsigned long long& id, TaskState*& task,
                                               const char* busy) {
    task = nullptr;
    if (!RequiredInteger(request, Control::kKeyTaskId, id, reply)) {
        return std::unique_lock<std::mutex>();
    }
    std::unique_lock<std::mutex> lock(mutex_);
    task = FindTask(id, reply, busy);
    return lock;
}

void Service::CmdRemove(const PObject& request, PObject& reply) {
    unsigned long long id = 0;
    {
        TaskState* found = nullptr;
        const auto lock = LockTask(request, reply, id, found, kCancelFirst);
        if (found == nullptr) {
            return;
        }
        std::string error;
        if (store_.Remove(id, error) < 0) {
            SetStatus(reply, Control::kInternal, error);
            return;
        }
        tasks_.erase(id);
        queue_.erase(std::remove(queue_.begin(), queue_.end(), id), queue_.end());
        scheduler_.Remove(id);
    }
    RefreshWatch();
    Logger::LogMsg(Logger::Note, "[NOTE] service.cpp(%d): task %llu removed\n", __LINE__, id);
}

PObject Service::TaskMap(const TaskState& state) const {
    PObject map;
    S2S::SyncTask2PObj(state.stored.task, map);
    // The stored task holds no password; the key goes so a reply never carries one.
    map.asMap().erase("pswd");
    const uint64_t id = state.stored.task.GetID();
    map[Control::kKeyTaskId] = static_cast<unsigned long long>(id);
    map[Control::kKeyAllowEmptySource] = state.stored.guard.allowEmptySource;
    map[Control::kKeyMaxDelete] = state.stored.guard.maxDelete.ToString();
    map[Control::kKeyNextRun] = static_cast<unsigned long long>(
        std::max(0L, state.pending_ms != 0 ? clock_.Now() : scheduler_.NextRun(id)));
    const char* stateName = state.running                    ? Control::kStateRunning
                            : state.queued                   ? Control::kStateQueued
                            : state.stored.paused || paused_ ? Control::kStatePaused
                                                             : Control::kStateIdle;
    map[Control::kKeyState] = stateName;
    return map;
}

void Service::CmdList(const PObject&, PObject& reply) {
    PObject::Array tasks;
    std::lock_guard<std::mutex> lock(mutex_);
    for (const auto& item : tasks_) {
        tasks.push_back(TaskMap(*item.second));
    }
    reply[Control::kKeyTasks] = tasks;
}

void Service::CmdShow(const PObject& request, PObject& reply) {
    unsigned long long id = 0;
    TaskState* found = nullptr;
    const auto lock = LockTask(request, reply, id, found);
    if (found == nullptr) {
        return;
    }
    reply[Control::kKeyTask] = TaskMap(*found);
}

void Service::CmdRun(const PObject& request, PObject& reply) {
    unsigned long long id = 0;
    TaskState* found = nullptr;
    const auto lock = LockTask(request, reply, id, found, "is running already");
    if (found == nullptr) {
        return;
    }
    Queue(id, Job::All(), "asked to run now");
}

void Service::CmdCancel(const PObject& request, PObject& reply) {
    unsigned long long id = 0;
    TaskState* found = nullptr;
    const auto lock = LockTask(request, reply, id, found);
    if (found == nullptr) {
        return;
    }
    TaskState& state = *found;
    if (state.queued) {
        state.queued = false;
        state.queued_job = Job();
        queue_.erase(std::remove(queue_.begin(), queue_.end(), id), queue_.end());
        return;
    }
    if (!state.running) {
        SetStatus(reply, Control::kNotRunning, "task " + std::to_string(id) + " is not running");
        return;
    }
    state.again = false;
    state.again_job = Job();
    state.cancel->store(true);
    Logger::LogMsg(Logger::Note, "[NOTE] service.cpp(%d): task %llu: cancel requested\n", __LINE__,
                   id);
}

PObject Service::StatusMap(const TaskState& state) const {
    const PObject task = TaskMap(state);
    PObject map;
    map[Control::kKeyTaskId] = static_cast<unsigned long long>(state.stored.task.GetID());
    map[Control::kKeyName] = state.stored.task.GetInfo().GetName();
    map[Control::kKeyState] = task[Control::kKeyState];
    map[Control::kKeyShare] = state.share;
    map[Control::kKeyBytesDone] = static_cast<unsigned long long>(state.bytes_done);
    map[Control::kKeyBytesTotal] = static_cast<unsigned long long>(state.bytes_total);
    map[Control::kKeyNextRun] = task[Control::kKeyNextRun];
    if (state.has_result) {
        map[Control::kKeyLastResult] = static_cast<unsigned long long>(state.last_result);
        map[Control::kKeyLastMessage] = state.last_message;
    }
    return map;
}

void Service::CmdStatus(const PObject& request, PObject& reply) {
    unsigned long long id = 0;
    bool present = false;
    if (!OptionalInteger(request, Control::kKeyTaskId, present, id, reply)) {
        return;
    }
    PObject::Array tasks;
    std::lock_guard<std::mutex> lock(mutex_);
    for (const auto& item : tasks_) {
        if (!present || item.first == id) {
            tasks.push_back(StatusMap(*item.second));
        }
    }
    if (present && tasks.empty()) {
        SetStatus(reply, Control::kNoSuchTask, "no task " + std::to_string(id));
        return;
    }
    reply[Control::kKeyTasks] = tasks;
}

void Service::CmdHistory(const PObject& request, PObject& reply) {
    unsigned long long id = 0;
    unsigned long long count = 20;
    bool present = false;
    bool has_count = false;
    if (!OptionalInteger(request, Control::kKeyTaskId, present, id, reply) ||
        !OptionalInteger(request, Control::kKeyCount, has_count, count, reply)) {
        return;
    }
    if (present && id == 0) {
        SetStatus(reply, Control::kNoSuchTask, "no task 0");
        return;
    }
    std::vector<RunRecord> runs;
    std::string error;
    if (store_.History(id, static_cast<unsigned>(std::min(count, 10000ULL)), runs, error) != 0) {
        SetStatus(reply, Control::kInternal, error);
        return;
    }
    PObject::Array out;
    for (const RunRecord& run : runs) {
        PObject map;
        map[Control::kKeyTaskId] = static_cast<unsigned long long>(run.task_id);
        map[Control::kKeyStart] = static_cast<unsigned long long>(run.start);
        map[Control::kKeyEnd] = static_cast<unsigned long long>(run.end);
        map[Control::kKeyResult] = static_cast<unsigned long long>(run.result);
        map[Control::kKeyMessage] = run.message;
        PObject::Array shares;
        for (const ShareRecord& share : run.shares) {
            PObject entry;
            entry[Control::kKeyName] = share.name;
            entry[Control::kKeyResult] = static_cast<unsigned long long>(share.result);
            entry[Control::kKeyFiles] = static_cast<unsigned long long>(share.files);
            entry[Control::kKeyBytes] = static_cast<unsigned long long>(share.bytes);
            entry[Control::kKeyReadBytes] = static_cast<unsigned long long>(share.read_bytes);
            entry[Control::kKeyMessage] = share.message;
            if (!share.guard.empty()) {
                entry[Control::kKeyGuard] = share.guard;
                if (share.would_delete >= 0) {
                    entry[Control::kKeyWouldDelete] =
                        static_cast<unsigned long long>(share.would_delete);
                }
            }
            shares.push_back(entry);
        }
        map[Control::kKeyShares] = shares;
        out.push_back(map);
    }
    reply[Control::kKeyRuns] = out;
}

void Service::CmdPause(const PObject& request, PObject& reply, bool pause) {
    unsigned long long id = 0;
    bool present = false;
    if (!OptionalInteger(request, Control::kKeyTaskId, present, id, reply)) {
        return;
    }
    std::string error;
    if (!present) {
        if (store_.SetSetting(kPausedSetting, pause ? "1" : "0", error) != 0) {
            SetStatus(reply, Control::kInternal, error);
            return;
        }
        std::lock_guard<std::mutex> lock(mutex_);
        paused_ = pause;
        Logger::LogMsg(Logger::Note, "[NOTE] service.cpp(%d): service %s\n", __LINE__,
                       pause ? "paused" : "resumed");
        return;
    }
    {
        std::lock_guard<std::mutex> lock(mutex_);
        TaskState* found = FindTask(id, reply);
        if (found == nullptr) {
            return;
        }
        if (store_.SetPaused(id, pause, error) != 0) {
            SetStatus(reply, Control::kInternal, error);
            return;
        }
        found->stored.paused = pause;
    }
    RefreshWatch();
}

}  // namespace s2sd
