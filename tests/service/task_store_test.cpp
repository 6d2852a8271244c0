// The task store opens a database of the first schema keeping its tasks and history (new columns
// take safe defaults, values stored later survive a reopen), refuses a newer one unaltered, and
// removes password files without a task at open, but not when the store holds no task at all.
#include "service/task_store.h"

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include "support/test_util.h"

namespace {

// The first schema, with one task (shares "docs"), one run and its share.
const char kFirstSchema[] =
    "CREATE TABLE tasks (id INTEGER PRIMARY KEY AUTOINCREMENT, name TEXT NOT NULL, user TEXT NOT"
    " NULL, server_ip TEXT NOT NULL, server_name TEXT NOT NULL, flags INTEGER NOT NULL, ssh_port"
    " INTEGER NOT NULL, max_bandwidth INTEGER NOT NULL, mode INTEGER NOT NULL, period INTEGER NOT"
    " NULL, repeats INTEGER NOT NULL, week TEXT NOT NULL, begin_year INTEGER NOT NULL,"
    " begin_month INTEGER NOT NULL, begin_day INTEGER NOT NULL, start_hour INTEGER NOT NULL,"
    " start_minute INTEGER NOT NULL, paused INTEGER NOT NULL DEFAULT 0, last_scheduled INTEGER"
    " NOT NULL);"
    "CREATE TABLE task_shares (task_id INTEGER NOT NULL, pos INTEGER NOT NULL, name TEXT NOT"
    " NULL, PRIMARY KEY (task_id, pos));"
    "CREATE TABLE runs (id INTEGER PRIMARY KEY AUTOINCREMENT, task_id INTEGER NOT NULL, start"
    " INTEGER NOT NULL, end INTEGER NOT NULL DEFAULT 0, result INTEGER NOT NULL DEFAULT 0, message"
    " TEXT NOT NULL DEFAULT '');"
    "CREATE TABLE run_shares (run_id INTEGER NOT NULL, pos INTEGER NOT NULL, name TEXT NOT NULL,"
    " result INTEGER NOT NULL, files INTEGER NOT NULL, bytes INTEGER NOT NULL, read_bytes INTEGER"
    " NOT NULL, message TEXT NOT NULL, PRIMARY KEY (run_id, pos));"
    "CREATE TABLE settings (key TEXT PRIMARY KEY, value TEXT NOT NULL);"
    "INSERT INTO tasks VALUES (1, 'nightly', 'backup', '127.0.0.1', '', 0, 22, 0, 2, 0, 0,"
    " '1111111', 2026, 1, 1, 2, 0, 0, 100);"
    "INSERT INTO task_shares VALUES (1, 0, 'docs');"
    "INSERT INTO runs VALUES (1, 1, 100, 110, 0, '');"
    "INSERT INTO run_shares VALUES (1, 0, 'docs', 0, 3, 300, 300, 'synced');";

void RunSql(const std::string& path, const char* sql) {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(path.c_str(), &db), SQLITE_OK);
    char* message = nullptr;
    EXPECT_EQ(sqlite3_exec(db, sql, nullptr, nullptr, &message), SQLITE_OK)
        << (message != nullptr ? message : "");
    sqlite3_free(message);
    sqlite3_close(db);
}

TEST(TaskStore, ADatabaseOfTheFirstSchemaIsMigratedAndKeepsItsTasksAndHistory) {
    s2s_test::TempDir dir;
    const std::string db = dir / "s2s.db";
    RunSql(db, kFirstSchema);
    // The password of task 1, and one left by a task that was never committed.
    ASSERT_EQ(mkdir((dir / "passwords").c_str(), 0700), 0);
    s2s_test::WriteFile(dir / "passwords/1", "secret");
    s2s_test::WriteFile(dir / "passwords/7", "secret");
    std::string error;
    {
        s2sd::TaskStore store;
        ASSERT_EQ(store.Open(db, dir / "passwords", error), 0) << error;
        EXPECT_EQ(access((dir / "passwords/1").c_str(), F_OK), 0);
        EXPECT_NE(access((dir / "passwords/7").c_str(), F_OK), 0);
        std::vector<s2sd::StoredTask> tasks;
        ASSERT_EQ(store.Load(tasks, error), 0) << error;
        ASSERT_EQ(tasks.size(), 1u);
        EXPECT_EQ(tasks[0].task.GetInfo().GetShareList().front(), "docs");
        EXPECT_FALSE(tasks[0].guard.allowEmptySource);
        EXPECT_FALSE(tasks[0].guard.maxDelete.set);
        std::vector<s2sd::RunRecord> runs;
        ASSERT_EQ(store.History(1, 10, runs, error), 0) << error;
        ASSERT_EQ(runs.size(), 1u);
        ASSERT_EQ(runs[0].shares.size(), 1u);
        EXPECT_EQ(runs[0].shares[0].files, 3u);
        EXPECT_EQ(runs[0].shares[0].guard, "");
        EXPECT_EQ(runs[0].shares[0].would_delete, -1);

        S2S::SourceGuardOptions guard;
        guard.allowEmptySource = true;
        ASSERT_TRUE(S2S::DeleteLimit::Parse("20%", guard.maxDelete, error));
        ASSERT_EQ(store.Update(tasks[0].task, guard, nullptr, error), 0) << error;
        int64_t run_id = 0;
        ASSERT_EQ(store.BeginRun(1, 200, run_id, error), 0) << error;
        s2sd::RunRecord run;
        run.id = run_id;
        run.end = 201;
        run.result = 10;
        run.shares.push_back({"docs", 0, 0, 0, 0, "too many", "max-delete", 7});
        ASSERT_EQ(store.EndRun(run, error), 0) << error;
    }
    s2sd::TaskStore again;
    ASSERT_EQ(again.Open(db, dir / "passwords", error), 0) << error;
    std::vector<s2sd::StoredTask> tasks;
    ASSERT_EQ(again.Load(tasks, error), 0) << error;
    ASSERT_EQ(tasks.size(), 1u);
    EXPECT_TRUE(tasks[0].guard.allowEmptySource);
    EXPECT_EQ(tasks[0].guard.maxDelete.ToString(), "20%");
    std::vector<s2sd::RunRecord> runs;
    ASSERT_EQ(again.History(1, 1, runs, error), 0) << error;
    ASSERT_EQ(runs.size(), 1u);
    EXPECT_EQ(runs[0].result, 10);
    EXPECT_EQ(runs[0].shares[0].guard, "max-delete");
    EXPECT_EQ(runs[0].shares[0].would_delete, 7);
}

// A zero-length database is a lost or truncated one: its tasks' password files are no orphans.
TEST(TaskStore, ANewerDatabaseIsRefusedUntouchedAndAnEmptyOneKeepsThePasswordFiles) {
    s2s_test::TempDir dir;
    const std::string db = dir / "s2s.db";
    RunSql(db, "PRAGMA user_version = 99");
    std::string error;
    EXPECT_EQ(s2sd::TaskStore().Open(db, dir / "passwords", error), -1);
    EXPECT_NE(error.find("newer"), std::string::npos) << error;
    RunSql(db, "CREATE TABLE tasks (x)");  // no table of the store was created in it

    s2s_test::WriteFile(db, "");
    s2s_test::MakeDirs(dir / "passwords", 0700);
    s2s_test::WriteFile(dir / "passwords/1", "secret");
    s2sd::TaskStore store;
    ASSERT_EQ(store.Open(db, dir / "passwords", error), 0) << error;
    EXPECT_EQ(access((dir / "passwords/1").c_str(), F_OK), 0);
}

}  // namespace
