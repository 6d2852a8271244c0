// TaskStore over SQLite. The schema holds the task fields as columns (shares in a table of their
// own, in order), the runs and their per-share results. A password file is written before the
// transaction that adds or changes its task commits, so a committed task always finds its
// password; a file left by a transaction that did not commit is removed at the next open (never
// when the task list cannot be read, nor when it is empty: that looks like a lost database).
#include "service/task_store.h"

#include <dirent.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <set>
#include <vector>

#include "s2s_logger.h"
#include "service/files.h"

namespace s2sd {

using S2S::Logger;

namespace {

const char kSchema[] =
    "CREATE TABLE IF NOT EXISTS tasks ("
    " id INTEGER PRIMARY KEY AUTOINCREMENT, name TEXT NOT NULL, user TEXT NOT NULL,"
    " server_ip TEXT NOT NULL, server_name TEXT NOT NULL, flags INTEGER NOT NULL,"
    " ssh_port INTEGER NOT NULL, max_bandwidth INTEGER NOT NULL, mode INTEGER NOT NULL,"
    " period INTEGER NOT NULL, repeats INTEGER NOT NULL, week TEXT NOT NULL,"
    " begin_year INTEGER NOT NULL, begin_month INTEGER NOT NULL, begin_day INTEGER NOT NULL,"
    " start_hour INTEGER NOT NULL, start_minute INTEGER NOT NULL,"
    " paused INTEGER NOT NULL DEFAULT 0, last_scheduled INTEGER NOT NULL,"
    " allow_empty_source INTEGER NOT NULL DEFAULT 0, max_delete TEXT NOT NULL DEFAULT '');"
    "CREATE TABLE IF NOT EXISTS task_shares ("
    " task_id INTEGER NOT NULL, pos INTEGER NOT NULL, name TEXT NOT NULL,"
    " PRIMARY KEY (task_id, pos));"
    "CREATE TABLE IF NOT EXISTS runs ("
    " id INTEGER PRIMARY KEY AUTOINCREMENT, task_id INTEGER NOT NULL, start INTEGER NOT NULL,"
    " end INTEGER NOT NULL DEFAULT 0, result INTEGER NOT NULL DEFAULT 0,"
    " message TEXT NOT NULL DEFAULT '');"
    "CREATE INDEX IF NOT EXISTS runs_by_task ON runs (task_id, id);"
    "CREATE TABLE IF NOT EXISTS run_shares ("
    " run_id INTEGER NOT NULL, pos INTEGER NOT NULL, name TEXT NOT NULL,"
    " result INTEGER NOT NULL, files INTEGER NOT NULL, bytes INTEGER NOT NULL,"
    " read_bytes INTEGER NOT NULL, message TEXT NOT NULL, guard TEXT NOT NULL DEFAULT '',"
    " would_delete INTEGER NOT NULL DEFAULT -1, PRIMARY KEY (run_id, pos));"
    "CREATE TABLE IF NOT EXISTS settings (key TEXT PRIMARY KEY, value TEXT NOT NULL);";

// Version 1 added the guard options of a task and the guard's verdict on a run's share.
constexpr int kSchemaVersion = 1;

// Columns added after the first schema, each with the default an older row takes.
const struct {
    const char* table;
    const char* column;
    const char* definition;
} kAddedColumns[] = {
    {"tasks", "allow_empty_source", "INTEGER NOT NULL DEFAULT 0"},
    {"tasks", "max_delete", "TEXT NOT NULL DEFAULT ''"},
    {"run_shares", "guard", "TEXT NOT NULL DEFAULT ''"},
    {"run_shares", "would_delete", "INTEGER NOT NULL DEFAULT -1"},
};

}  // namespace

// A prepared statement, finalised on destruction.
class TaskStore::Statement {
  public:
    Statement(sqlite3* db, const char* sql) : db_(db) {
        if (sqlite3_prepare_v2(db, sql, -1, &stmt_, nullptr) != SQLITE_OK) {
            stmt_ = nullptr;
        }
    }
    ~Statement() { sqlite3_finalize(stmt_); }
    Statement(const Statement&) = delete;
    Statement& operator=(const Statement&) = delete;

    bool Ok() const { return stmt_ != nullptr; }
    Statement& Bind(int index, long long value) {
        sqlite3_bind_int64(stmt_, index, value);
        return *this;
    }
    Statement& Bind(int index, const std::string& value) {
        sqlite3_bind_text(stmt_, index, value.c_str(), static_cast<int>(value.size()),
                          SQLITE_TRANSIENT);
        return *this;
    }
    // SQLITE_ROW, SQLITE_DONE or an error code.
    int Step() { return stmt_ != nullptr ? sqlite3_step(stmt_) : SQLITE_ERROR; }
    bool Run(std::string& error) {
        const int rc = Step();
        if (rc != SQLITE_DONE && rc != SQLITE_ROW) {
            error = std::string("task store: ") + sqlite3_errmsg(db_);
            return false;
        }
        return true;
    }
    long long Int(int column) const { return sqlite3_column_int64(stmt_, column); }
    std::string Text(int column) const {
        const unsigned char* text = sqlite3_column_text(stmt_, column);
        return text != nullptr ? reinterpret_cast<const char*>(text) : "";
    }

  private:
    sqlite3* db_;
    sqlite3_stmt* stmt_ = nullptr;
};

// One transaction: rolled back on destruction unless committed.
class TaskStore::Transaction {
  public:
    explicit Transaction(TaskStore& store) : store_(store) {}
    ~Transaction() {
        if (begun_ && !done_) {
            std::string ignored;
            store_.Exec("ROLLBACK", ignored);
        }
    }
    Transaction(const Transaction&) = delete;
    Transaction& operator=(const Transaction&) = delete;

    bool Begin(std::string& error) {
        begun_ = store_.Exec("BEGIN IMMEDIATE", error) == 0;
        return begun_;
    }
    bool Commit(std::string& error) {
        done_ = store_.Exec("COMMIT", error) == 0;
        return done_;
    }

  private:
    TaskStore& store_;
    bool begun_ = false;
    bool done_ = false;
};

TaskStore::~TaskStore() {
    if (db_ != nullptr) {
        sqlite3_close(db_);
    }
}

int TaskStore::Exec(const char* sql, std::string& error) {
    char* message = nullptr;
    if (sqlite3_exec(db_, sql, nullptr, nullptr, &message) != SQLITE_OK) {
        error = std::string("task store: ") + (message != nullptr ? message : "failed");
        sqlite3_free(message);
        return -1;
    }
    return 0;
}

int TaskStore::Open(const std::string& db_path, const std::string& password_dir,
                    std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    password_dir_ = password_dir;
    const std::string db_dir = db_path.substr(0, db_path.rfind('/'));
    if (MakeDirs(db_dir, 0700, error) != 0 || MakeDirs(password_dir, 0700, error) != 0) {
        return -1;
    }
    chmod(password_dir.c_str(), 0700);
    // The database, its log and shared-memory files take the mode of a file created now.
    const mode_t old_mask = umask(077);
    const int rc =
        sqlite3_open_v2(db_path.c_str(), &db_,
                        SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX, nullptr);
    umask(old_mask);
    if (rc != SQLITE_OK) {
        error = "cannot open the task store " + db_path + ": " +
                (db_ != nullptr ? sqlite3_errmsg(db_) : "out of memory");
        return -1;
    }
    chmod(db_path.c_str(), 0600);
    sqlite3_busy_timeout(db_, 5000);
    if (Exec("PRAGMA journal_mode=WAL", error) != 0 ||
        Exec("PRAGMA synchronous=FULL", error) != 0 || Migrate(error) != 0) {
        return -1;
    }
    RemoveOrphanPasswords();
    return 0;
}

// Brings the schema to kSchemaVersion in one transaction; a database of a newer schema is left
// as it is and refused.
int TaskStore::Migrate(std::string& error) {
    Transaction txn(*this);
    if (!txn.Begin(error)) {
        return -1;
    }
    Statement version(db_, "PRAGMA user_version");
    if (version.Step() != SQLITE_ROW) {
        error = std::string("task store: ") + sqlite3_errmsg(db_);
        return -1;
    }
    const long long found = version.Int(0);
    if (found > kSchemaVersion) {
        error = "the task store was written by a newer s2sd (schema " + std::to_string(found) +
                ", this one knows " + std::to_string(kSchemaVersion) + ")";
        return -1;
    }
    if (found == kSchemaVersion) {
        return 0;
    }
    // A new database gets every table as it is now; an older one its missing tables and columns.
    if (Exec(kSchema, error) != 0) {
        return -1;
    }
    for (const auto& added : kAddedColumns) {
        Statement has(db_, "SELECT COUNT(*) FROM pragma_table_info(?) WHERE name = ?");
        has.Bind(1, std::string(added.table)).Bind(2, std::string(added.column));
        if (has.Step() != SQLITE_ROW) {
            error = std::string("task store: ") + sqlite3_errmsg(db_);
            return -1;
        }
        if (has.Int(0) == 0) {
            const std::string alter = std::string("ALTER TABLE ") + added.table + " ADD COLUMN " +
                                      added.column + " " + added.definition;
            if (Exec(alter.c_str(), error) != 0) {
                return -1;
            }
        }
    }
    const std::string set_version = "PRAGMA user_version = " + std::to_string(kSchemaVersion);
    if (Exec(set_version.c_str(), error) != 0) {
        return -1;
    }
    return txn.Commit(error) ? 0 : -1;
}

std::string TaskStore::PasswordPath(uint64_t id) const {
    return password_dir_ + "/" + std::to_string(id);
}

void TaskStore::RemoveOrphanPasswords() {
    // Only a task list read to its end decides which files are orphans; an empty list beside
    // password files more likely means a lost or damaged database than removed tasks, so those
    // files stay for the administrator to look at.
    std::set<std::string> ids;
    Statement select(db_, "SELECT id FROM tasks");
    int rc = SQLITE_ROW;
    while ((rc = select.Step()) == SQLITE_ROW) {
        ids.insert(std::to_string(select.Int(0)));
    }
    if (rc != SQLITE_DONE) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] task_store.cpp(%d): the task list cannot be read (%s): no "
                       "password file is removed\n",
                       __LINE__, sqlite3_errmsg(db_));
        return;
    }
    DIR* dir = opendir(password_dir_.c_str());
    if (dir == nullptr) {
        return;
    }
    std::vector<std::string> orphans;
    while (struct dirent* entry = readdir(dir)) {
        const std::string name = entry->d_name;
        if (name != "." && name != ".." && ids.count(name) == 0) {
            orphans.push_back(name);
        }
    }
    closedir(dir);
    if (ids.empty() && !orphans.empty()) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] task_store.cpp(%d): the task store holds no task but %s holds "
                       "%zu password files: they are kept (remove them by hand if the tasks are "
                       "really gone)\n",
                       __LINE__, password_dir_.c_str(), orphans.size());
        return;
    }
    for (const std::string& name : orphans) {
        const std::string path = password_dir_ + "/" + name;
        if (unlink(path.c_str()) != 0) {
            Logger::LogMsg(Logger::Warning, "[WARNING] task_store.cpp(%d): cannot remove %s: %s\n",
                           __LINE__, path.c_str(), std::strerror(errno));
        }
    }
}

int TaskStore::WritePassword(uint64_t id, const std::string& password, std::string& error) {
    return ReplaceFile(PasswordPath(id), password, 0600, error);
}

int TaskStore::WriteShares(uint64_t id, const S2S::SyncTask& task, std::string& error) {
    Statement drop(db_, "DELETE FROM task_shares WHERE task_id = ?");
    if (!drop.Bind(1, static_cast<long long>(id)).Run(error)) {
        return -1;
    }
    long long pos = 0;
    for (const std::string& name : task.GetInfo().GetShareList()) {
        Statement insert(db_, "INSERT INTO task_shares (task_id, pos, name) VALUES (?, ?, ?)");
        if (!insert.Bind(1, static_cast<long long>(id)).Bind(2, pos++).Bind(3, name).Run(error)) {
            return -1;
        }
    }
    return 0;
}

namespace {

// Binds the definition columns from index 1 on, in the order of the UPDATE and INSERT below.
template <typename S>
void BindDefinition(S& stmt, const S2S::SyncTask& task, const S2S::SourceGuardOptions& guard) {
    const S2S::TaskInfo& info = task.GetInfo();
    const S2S::SyncInfo& sync = info.GetSyncInfo();
    const S2S::Schedule& schedule = info.GetSchedule();
    stmt.Bind(1, info.GetName())
        .Bind(2, sync.GetUser())
        .Bind(3, sync.GetServerIP())
        .Bind(4, sync.GetServerName())
        .Bind(5, static_cast<long long>(sync.GetSyncConfigFlag()))
        .Bind(6, static_cast<long long>(sync.GetSSHPort()))
        .Bind(7, static_cast<long long>(sync.GetMaxBandwidth()))
        .Bind(8, static_cast<long long>(schedule.GetMode()))
        .Bind(9, static_cast<long long>(schedule.GetPeriodSeconds()))
        .Bind(10, static_cast<long long>(schedule.GetRepeatTimesInDay()))
        .Bind(11, schedule.GetWeekSchedule())
        .Bind(12, static_cast<long long>(schedule.GetBeginYear()))
        .Bind(13, static_cast<long long>(schedule.GetBeginMonth()))
        .Bind(14, static_cast<long long>(schedule.GetBeginDay()))
        .Bind(15, static_cast<long long>(schedule.GetStartHour()))
        .Bind(16, static_cast<long long>(schedule.GetStartMinute()))
        .Bind(17, guard.allowEmptySource ? 1 : 0)
        .Bind(18, guard.maxDelete.ToString());
}

}  // namespace

int TaskStore::Add(S2S::SyncTask& task, const S2S::SourceGuardOptions& guard,
                   const std::string& password, long now, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    Transaction txn(*this);
    if (!txn.Begin(error)) {
        return -1;
    }
    Statement insert(db_,
                     "INSERT INTO tasks (name, user, server_ip, server_name, flags, ssh_port,"
                     " max_bandwidth, mode, period, repeats, week, begin_year, begin_month,"
                     " begin_day, start_hour, start_minute, allow_empty_source, max_delete,"
                     " last_scheduled) VALUES (?,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?)");
    BindDefinition(insert, task, guard);
    insert.Bind(19, static_cast<long long>(now));
    if (!insert.Run(error)) {
        return -1;
    }
    const uint64_t id = static_cast<uint64_t>(sqlite3_last_insert_rowid(db_));
    if (WriteShares(id, task, error) != 0 || WritePassword(id, password, error) != 0) {
        return -1;
    }
    if (!txn.Commit(error)) {
        unlink(PasswordPath(id).c_str());
        return -1;
    }
    task.SetID(id);
    return 0;
}

int TaskStore::Update(const S2S::SyncTask& task, const S2S::SourceGuardOptions& guard,
                      const std::string* password, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    Transaction txn(*this);
    if (!txn.Begin(error)) {
        return -1;
    }
    Statement update(db_,
                     "UPDATE tasks SET name=?, user=?, server_ip=?, server_name=?, flags=?,"
                     " ssh_port=?, max_bandwidth=?, mode=?, period=?, repeats=?, week=?,"
                     " begin_year=?, begin_month=?, begin_day=?, start_hour=?, start_minute=?,"
                     " allow_empty_source=?, max_delete=? WHERE id=?");
    BindDefinition(update, task, guard);
    update.Bind(19, static_cast<long long>(task.GetID()));
    if (!update.Run(error)) {
        return -1;
    }
    if (sqlite3_changes(db_) == 0) {
        return 1;
    }
    if (WriteShares(task.GetID(), task, error) != 0) {
        return -1;
    }
    // A new password replaces the old file before the commit; should the commit fail, the task
    // keeps its old definition with the new password, which the administrator just asked for.
    if (password != nullptr && WritePassword(task.GetID(), *password, error) != 0) {
        return -1;
    }
    return txn.Commit(error) ? 0 : -1;
}

int TaskStore::Remove(uint64_t id, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    Transaction txn(*this);
    if (!txn.Begin(error)) {
        return -1;
    }
    Statement drop(db_, "DELETE FROM tasks WHERE id = ?");
    if (!drop.Bind(1, static_cast<long long>(id)).Run(error)) {
        return -1;
    }
    if (sqlite3_changes(db_) == 0) {
        return 1;
    }
    Statement shares(db_, "DELETE FROM task_shares WHERE task_id = ?");
    if (!shares.Bind(1, static_cast<long long>(id)).Run(error) || !txn.Commit(error)) {
        return -1;
    }
    unlink(PasswordPath(id).c_str());
    return 0;
}

int TaskStore::Load(std::vector<StoredTask>& tasks, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    tasks.clear();
    Statement select(db_,
                     "SELECT id, name, user, server_ip, server_name, flags, ssh_port,"
                     " max_bandwidth, mode, period, repeats, week, begin_year, begin_month,"
                     " begin_day, start_hour, start_minute, paused, last_scheduled,"
                     " allow_empty_source, max_delete FROM tasks ORDER BY id");
    if (!select.Ok()) {
        error = std::string("task store: ") + sqlite3_errmsg(db_);
        return -1;
    }
    int rc;
    while ((rc = select.Step()) == SQLITE_ROW) {
        StoredTask stored;
        S2S::TaskInfo info;
        S2S::SyncInfo sync;
        S2S::Schedule schedule;
        info.SetName(select.Text(1));
        sync.SetUser(select.Text(2));
        sync.SetServerIP(select.Text(3));
        sync.SetServerName(select.Text(4));
        sync.SetSyncConfigFlag(static_cast<unsigned>(select.Int(5)));
        sync.SetSSHPort(static_cast<unsigned>(select.Int(6)));
        sync.SetMaxBandwidth(static_cast<unsigned>(select.Int(7)));
        schedule.SetMode(static_cast<S2S::SCHD_MODE>(select.Int(8)));
        schedule.SetPeriod(static_cast<long>(select.Int(9)));
        schedule.SetRepeatTimesInDay(static_cast<long>(select.Int(10)));
        if (select.Int(9) != 0) {
            schedule.SetPeriod(static_cast<long>(select.Int(9)));  // coupled setters: keep both
        }
        schedule.SetWeekSchedule(select.Text(11));
        schedule.SetBeginYear(static_cast<int>(select.Int(12)));
        schedule.SetBeginMonth(static_cast<int>(select.Int(13)));
        schedule.SetBeginDay(static_cast<int>(select.Int(14)));
        schedule.SetStartHour(static_cast<int>(select.Int(15)));
        schedule.SetStartMinute(static_cast<int>(select.Int(16)));
        std::list<std::string> shares;
        Statement names(db_, "SELECT name FROM task_shares WHERE task_id = ? ORDER BY pos");
        names.Bind(1, select.Int(0));
        while (names.Step() == SQLITE_ROW) {
            shares.push_back(names.Text(0));
        }
        info.SetShareList(shares);
        info.SetSyncInfo(sync);
        info.SetSchedule(schedule);
        stored.task.SetID(static_cast<unsigned long long>(select.Int(0)));
        stored.task.SetInfo(info);
        stored.paused = select.Int(17) != 0;
        stored.last_scheduled = static_cast<long>(select.Int(18));
        stored.guard.allowEmptySource = select.Int(19) != 0;
        const std::string max_delete = select.Text(20);
        std::string problem;
        if (!max_delete.empty() &&
            !S2S::DeleteLimit::Parse(max_delete, stored.guard.maxDelete, problem)) {
            // Only validated limits are stored; a row changed by hand keeps the task safe.
            stored.guard.maxDelete.set = true;
            stored.guard.maxDelete.percent = false;
            stored.guard.maxDelete.value = 0;
            Logger::LogMsg(Logger::Error,
                           "[ERROR] task_store.cpp(%d): task %lld: stored max_delete '%s' is "
                           "invalid (%s); no deletion is allowed until the task is updated\n",
                           __LINE__, select.Int(0), max_delete.c_str(), problem.c_str());
        }
        tasks.push_back(stored);
    }
    if (rc != SQLITE_DONE) {
        error = std::string("task store: ") + sqlite3_errmsg(db_);
        return -1;
    }
    return 0;
}

int TaskStore::SetPaused(uint64_t id, bool paused, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    Statement update(db_, "UPDATE tasks SET paused = ? WHERE id = ?");
    if (!update.Bind(1, paused ? 1 : 0).Bind(2, static_cast<long long>(id)).Run(error)) {
        return -1;
    }
    return sqlite3_changes(db_) == 0 ? 1 : 0;
}

int TaskStore::SetLastScheduled(uint64_t id, long when, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    Statement update(db_, "UPDATE tasks SET last_scheduled = ? WHERE id = ?");
    if (!update.Bind(1, static_cast<long long>(when))
             .Bind(2, static_cast<long long>(id))
             .Run(error)) {
        return -1;
    }
    return sqlite3_changes(db_) == 0 ? 1 : 0;
}

int TaskStore::Password(uint64_t id, std::string& password, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (!ReadFile(PasswordPath(id), password)) {
        error = "cannot read the password of task " + std::to_string(id);
        return -1;
    }
    return 0;
}

int TaskStore::BeginRun(uint64_t task_id, long start, int64_t& run_id, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    Transaction txn(*this);
    if (!txn.Begin(error)) {
        return -1;
    }
    Statement insert(db_, "INSERT INTO runs (task_id, start) VALUES (?, ?)");
    if (!insert.Bind(1, static_cast<long long>(task_id))
             .Bind(2, static_cast<long long>(start))
             .Run(error)) {
        return -1;
    }
    run_id = sqlite3_last_insert_rowid(db_);
    Statement old_shares(db_,
                         "DELETE FROM run_shares WHERE run_id IN (SELECT id FROM runs WHERE"
                         " task_id = ? ORDER BY id DESC LIMIT -1 OFFSET ?)");
    Statement old_runs(db_,
                       "DELETE FROM runs WHERE id IN (SELECT id FROM runs WHERE task_id = ?"
                       " ORDER BY id DESC LIMIT -1 OFFSET ?)");
    if (!old_shares.Bind(1, static_cast<long long>(task_id)).Bind(2, kRunsKept).Run(error) ||
        !old_runs.Bind(1, static_cast<long long>(task_id)).Bind(2, kRunsKept).Run(error)) {
        return -1;
    }
    return txn.Commit(error) ? 0 : -1;
}

int TaskStore::EndRun(const RunRecord& run, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    Transaction txn(*this);
    if (!txn.Begin(error)) {
        return -1;
    }
    Statement update(db_, "UPDATE runs SET end = ?, result = ?, message = ? WHERE id = ?");
    if (!update.Bind(1, static_cast<long long>(run.end))
             .Bind(2, run.result)
             .Bind(3, run.message)
             .Bind(4, run.id)
             .Run(error)) {
        return -1;
    }
    long long pos = 0;
    for (const ShareRecord& share : run.shares) {
        Statement insert(db_,
                         "INSERT OR REPLACE INTO run_shares (run_id, pos, name, result, files,"
                         " bytes, read_bytes, message, guard, would_delete)"
                         " VALUES (?,?,?,?,?,?,?,?,?,?)");
        insert.Bind(1, run.id)
            .Bind(2, pos++)
            .Bind(3, share.name)
            .Bind(4, share.result)
            .Bind(5, static_cast<long long>(share.files))
            .Bind(6, static_cast<long long>(share.bytes))
            .Bind(7, static_cast<long long>(share.read_bytes))
            .Bind(8, share.message)
            .Bind(9, share.guard)
            .Bind(10, share.would_delete);
        if (!insert.Run(error)) {
            return -1;
        }
    }
    return txn.Commit(error) ? 0 : -1;
}

int TaskStore::CloseInterruptedRuns(long now, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    Statement update(db_,
                     "UPDATE runs SET end = ?, result = ?, message = 'the service stopped during"
                     " the run' WHERE end = 0");
    return update.Bind(1, static_cast<long long>(now)).Bind(2, kResultInterrupted).Run(error) ? 0
                                                                                              : -1;
}

int TaskStore::History(uint64_t task_id, unsigned count, std::vector<RunRecord>& runs,
                       std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    runs.clear();
    Statement select(db_, task_id != 0 ? "SELECT id, task_id, start, end, result, message FROM runs"
                                         " WHERE task_id = ? ORDER BY id DESC LIMIT ?"
                                       : "SELECT id, task_id, start, end, result, message FROM runs"
                                         " WHERE ? = 0 ORDER BY id DESC LIMIT ?");
    select.Bind(1, static_cast<long long>(task_id)).Bind(2, static_cast<long long>(count));
    int rc;
    while ((rc = select.Step()) == SQLITE_ROW) {
        RunRecord run;
        run.id = select.Int(0);
        run.task_id = static_cast<uint64_t>(select.Int(1));
        run.start = static_cast<long>(select.Int(2));
        run.end = static_cast<long>(select.Int(3));
        run.result = static_cast<int>(select.Int(4));
        run.message = select.Text(5);
        Statement shares(db_,
                         "SELECT name, result, files, bytes, read_bytes, message, guard,"
                         " would_delete FROM run_shares WHERE run_id = ? ORDER BY pos");
        shares.Bind(1, run.id);
        while (shares.Step() == SQLITE_ROW) {
            ShareRecord share;
            share.name = shares.Text(0);
            share.result = static_cast<int>(shares.Int(1));
            share.files = static_cast<uint64_t>(shares.Int(2));
            share.bytes = static_cast<uint64_t>(shares.Int(3));
            share.read_bytes = static_cast<uint64_t>(shares.Int(4));
            share.message = shares.Text(5);
            share.guard = shares.Text(6);
            share.would_delete = shares.Int(7);
            run.shares.push_back(share);
        }
        runs.push_back(run);
    }
    if (rc != SQLITE_DONE) {
        error = std::string("task store: ") + sqlite3_errmsg(db_);
        return -1;
    }
    return 0;
}

int TaskStore::GetSetting(const std::string& key, std::string& value, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    Statement select(db_, "SELECT value FROM settings WHERE key = ?");
    select.Bind(1, key);
    const int rc = select.Step();
    if (rc == SQLITE_ROW) {
        value = select.Text(0);
        return 0;
    }
    if (rc == SQLITE_DONE) {
        return 1;
    }
    error = std::string("task store: ") + sqlite3_errmsg(db_);
    return -1;
}

int TaskStore::SetSetting(const std::string& key, const std::string& value, std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    Statement upsert(db_, "INSERT OR REPLACE INTO settings (key, value) VALUES (?, ?)");
    return upsert.Bind(1, key).Bind(2, value).Run(error) ? 0 : -1;
}

}  // namespace s2sd
