// TaskStore: the daemon's tasks and their run history in one SQLite database (WAL mode), and
// each task's password in a file of its own (mode 0600) beside it. Every change is one
// transaction, so a kill at any moment leaves the old state or the new one. A password never
// enters the database, the history or a task returned from here.
//
// Thread-safe: one mutex serialises every call.
#ifndef S2S_SERVICE_TASK_STORE_H
#define S2S_SERVICE_TASK_STORE_H

#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#include "s2s_source_guard.h"
#include "s2s_sync_obj.h"

struct sqlite3;

namespace s2sd {

struct StoredTask {
    S2S::SyncTask task;  // without its password
    // The checks on each share's source before its data run (task map keys "allow_empty_source"
    // and "max_delete", as in task files).
    S2S::SourceGuardOptions guard;
    bool paused = false;
    long last_scheduled = 0;  // when the last scheduled run was due (or the task was added)
};

struct ShareRecord {
    std::string name;
    int result = 0;
    uint64_t files = 0;
    uint64_t bytes = 0;
    uint64_t read_bytes = 0;
    std::string message;
    std::string guard;            // why the source check refused the share; "" when it did not
    long long would_delete = -1;  // what the refused run would have deleted; -1: not counted
};

struct RunRecord {
    int64_t id = 0;
    uint64_t task_id = 0;
    long start = 0;
    long end = 0;  // 0 while the run goes on
    int result = 0;
    std::string message;
    std::vector<ShareRecord> shares;
};

class TaskStore {
  public:
    // The result of a run the service did not see end (it was stopped or killed meanwhile).
    static constexpr int kResultInterrupted = 99;
    // Runs kept per task; older ones are dropped when a run is added.
    static constexpr int kRunsKept = 500;

    TaskStore() = default;
    ~TaskStore();
    TaskStore(const TaskStore&) = delete;
    TaskStore& operator=(const TaskStore&) = delete;

    // Opens (creating) the database and the password directory. 0, or -1 with `error`.
    int Open(const std::string& db_path, const std::string& password_dir, std::string& error);

    // All calls below: 0, 1 when the task does not exist, -1 with `error` for a store failure.
    // Stores a new task with its guard options; its id is set on `task`.
    int Add(S2S::SyncTask& task, const S2S::SourceGuardOptions& guard, const std::string& password,
            long now, std::string& error);
    // Replaces a task's definition and guard options; the password only when `password` is not
    // null.
    int Update(const S2S::SyncTask& task, const S2S::SourceGuardOptions& guard,
               const std::string* password, std::string& error);
    int Remove(uint64_t id, std::string& error);
    int Load(std::vector<StoredTask>& tasks, std::string& error);
    int SetPaused(uint64_t id, bool paused, std::string& error);
    int SetLastScheduled(uint64_t id, long when, std::string& error);
    // The password of a task, for a run; empty when it has none.
    int Password(uint64_t id, std::string& password, std::string& error);

    int BeginRun(uint64_t task_id, long start, int64_t& run_id, std::string& error);
    int EndRun(const RunRecord& run, std::string& error);
    // Runs without an end (the service died during them) get `now` and kResultInterrupted.
    int CloseInterruptedRuns(long now, std::string& error);
    // The last `count` runs, newest first; of one task, or of all when `task_id` is 0.
    int History(uint64_t task_id, unsigned count, std::vector<RunRecord>& runs, std::string& error);

    // Service-wide settings (such as the whole service being paused).
    int GetSetting(const std::string& key, std::string& value, std::string& error);
    int SetSetting(const std::string& key, const std::string& value, std::string& error);

  private:
    class Statement;
    class Transaction;
    int Exec(const char* sql, std::string& error);
    int Migrate(std::string& error);
    int WriteShares(uint64_t id, const S2S::SyncTask& task, std::string& error);
    int WritePassword(uint64_t id, const std::string& password, std::string& error);
    std::string PasswordPath(uint64_t id) const;
    void RemoveOrphanPasswords();

    std::mutex mutex_;
    sqlite3* db_ = nullptr;
    std::string password_dir_;
};

}  // namespace s2sd

#endif  // S2S_SERVICE_TASK_STORE_H
