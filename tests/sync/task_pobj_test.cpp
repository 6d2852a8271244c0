// Task <-> PObject map: the exact key set and kinds, reading with defaults and presence tests,
// the period/repeat coupling, absorbed wrong kinds, and a task carried between two processes over
// a real local socket with only the documented losses.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <set>
#include <string>

#include "s2s_ipc.h"
#include "s2s_pobject.h"
#include "s2s_sync_obj.h"
#include "sync/sync_test_util.h"

namespace {

using S2S::PObject;
using S2S::Schedule;
using S2S::SyncInfo;
using S2S::SyncTask;
using S2S::TaskInfo;

SyncTask FullTask() {
    SyncTask task;
    task.SetID(0xFEDCBA9876543210ull);
    TaskInfo info;
    info.SetName("Nächtliche Sicherung");
    info.SetShareList({"docs", "media", "a share"});
    SyncInfo server;
    server.SetSyncConfigFlag(0xF5);  // compression and block level, plus bits that do not travel
    server.SetSSHPort(65535);
    server.SetMaxBandwidth(4294967295u);
    server.SetUser("backup");
    server.SetPassword("s3cr3t \"quoted\"");
    server.SetServerIP("192.0.2.7");
    server.SetServerName("nas.example");
    info.SetSyncInfo(server);
    Schedule schedule;
    schedule.SetMode(S2S::SCHD_WEEKLY);
    schedule.SetPeriod(5430);  // 1:30:30, the 30 seconds are lost on the way
    schedule.SetRepeatTimesInDay(3);
    schedule.SetWeekSchedule("0101011");
    schedule.SetBeginYear(2024);
    schedule.SetBeginMonth(2);
    schedule.SetBeginDay(29);
    schedule.SetStartHour(7);
    schedule.SetStartMinute(45);
    info.SetSchedule(schedule);
    task.SetInfo(info);
    return task;
}

// Everything but the documented losses: the period's seconds and the unknown flag bits.
void ExpectSameTask(const SyncTask& want, const SyncTask& got) {
    EXPECT_EQ(want.GetID(), got.GetID());
    const TaskInfo& a = want.GetInfo();
    const TaskInfo& b = got.GetInfo();
    EXPECT_EQ(a.GetName(), b.GetName());
    EXPECT_EQ(a.GetShareList(), b.GetShareList());
    EXPECT_EQ(a.GetSyncInfo().GetSyncConfigFlag() & 7u, b.GetSyncInfo().GetSyncConfigFlag());
    EXPECT_EQ(a.GetSyncInfo().GetSSHPort(), b.GetSyncInfo().GetSSHPort());
    EXPECT_EQ(a.GetSyncInfo().GetMaxBandwidth(), b.GetSyncInfo().GetMaxBandwidth());
    EXPECT_EQ(a.GetSyncInfo().GetUser(), b.GetSyncInfo().GetUser());
    EXPECT_EQ(a.GetSyncInfo().GetPassword(), b.GetSyncInfo().GetPassword());
    EXPECT_EQ(a.GetSyncInfo().GetServerIP(), b.GetSyncInfo().GetServerIP());
    EXPECT_EQ(a.GetSyncInfo().GetServerName(), b.GetSyncInfo().GetServerName());
    const Schedule& s = a.GetSchedule();
    const Schedule& t = b.GetSchedule();
    EXPECT_EQ(s.GetMode(), t.GetMode());
    EXPECT_EQ(s.GetPeriodSeconds() / 60 * 60, t.GetPeriodSeconds());
    EXPECT_EQ(s.GetRepeatTimesInDay(), t.GetRepeatTimesInDay());
    EXPECT_EQ(s.GetWeekSchedule(), t.GetWeekSchedule());
    EXPECT_EQ(s.GetBeginYear(), t.GetBeginYear());
    EXPECT_EQ(s.GetBeginMonth(), t.GetBeginMonth());
    EXPECT_EQ(s.GetBeginDay(), t.GetBeginDay());
    EXPECT_EQ(s.GetStartHour(), t.GetStartHour());
    EXPECT_EQ(s.GetStartMinute(), t.GetStartMinute());
}

TEST(TaskToPObject, WritesExactlyTheTaskKeysWithTheirKinds) {
    PObject obj;
    S2S::SyncTask2PObj(FullTask(), obj);
    ASSERT_TRUE(obj.isMap());
    std::set<std::string> keys;
    for (const auto& entry : obj.asMap()) {
        keys.insert(entry.first);
    }
    const std::set<std::string> expected = {"id",
                                            "name",
                                            "share_list",
                                            "user",
                                            "pswd",
                                            "server_ip",
                                            "server_name",
                                            "compress",
                                            "block",
                                            "ssh",
                                            "ssh_port",
                                            "max_bandwidth",
                                            "schedule_mode",
                                            "schedule_begin_year",
                                            "schedule_begin_month",
                                            "schedule_begin_day",
                                            "schedule_begin_hour",
                                            "schedule_begin_min",
                                            "week_schd",
                                            "period_hour",
                                            "period_minute",
                                            "repeat_times_in_day"};
    EXPECT_EQ(expected, keys);

    EXPECT_EQ(0xFEDCBA9876543210ull, obj["id"].asUInt64());
    EXPECT_TRUE(obj["name"].isString());
    ASSERT_TRUE(obj["share_list"].isArray());
    ASSERT_EQ(3u, obj["share_list"].asArray().size());
    EXPECT_EQ("media", obj["share_list"].asArray()[1].asString());
    EXPECT_EQ("s3cr3t \"quoted\"", obj["pswd"].asString());
    EXPECT_TRUE(obj["compress"].isInteger());
    EXPECT_EQ(1u, obj["compress"].asUInt64());
    EXPECT_EQ(1u, obj["block"].asUInt64());
    EXPECT_EQ(0u, obj["ssh"].asUInt64());
    EXPECT_EQ(65535u, obj["ssh_port"].asUInt64());
    EXPECT_EQ(4294967295u, obj["max_bandwidth"].asUInt64());  // not sign-extended
    EXPECT_TRUE(obj["schedule_mode"].isInteger());            // the number, not "weekly"
    EXPECT_EQ(2u, obj["schedule_mode"].asUInt64());
    EXPECT_EQ(2024u, obj["schedule_begin_year"].asUInt64());
    EXPECT_EQ(2u, obj["schedule_begin_month"].asUInt64());
    EXPECT_EQ(29u, obj["schedule_begin_day"].asUInt64());
    EXPECT_EQ(7u, obj["schedule_begin_hour"].asUInt64());
    EXPECT_EQ(45u, obj["schedule_begin_min"].asUInt64());
    EXPECT_EQ("0101011", obj["week_schd"].asString());
    EXPECT_EQ(1u, obj["period_hour"].asUInt64());
    EXPECT_EQ(30u, obj["period_minute"].asUInt64());
    EXPECT_EQ(3u, obj["repeat_times_in_day"].asUInt64());

    PObject info_only;
    S2S::TaskInfo2PObj(FullTask().GetInfo(), info_only);
    EXPECT_FALSE(info_only.hasMember("id"));
    EXPECT_EQ(keys.size() - 1, info_only.asMap().size());
}

TEST(TaskToPObject, SignedFieldsAreSignExtended) {
    SyncTask task;
    task.GetInfo().GetSchedule().SetBeginDay(-5);
    task.GetInfo().GetSchedule().SetMode(static_cast<S2S::SCHD_MODE>(-1));
    PObject obj;
    S2S::SyncTask2PObj(task, obj);
    EXPECT_EQ(0xFFFFFFFFFFFFFFFBull, obj["schedule_begin_day"].asUInt64());
    EXPECT_EQ(0xFFFFFFFFFFFFFFFFull, obj["schedule_mode"].asUInt64());
    SyncTask back;
    S2S::PObj2SyncTask(obj, back);
    EXPECT_EQ(-5, back.GetInfo().GetSchedule().GetBeginDay());
    EXPECT_EQ(-1, static_cast<int>(back.GetInfo().GetSchedule().GetMode()));
}

TEST(TaskToPObject, TargetKeepsItsOwnKeysAndBecomesAMap) {
    PObject obj;
    obj["status"] = 3;
    obj["name"] = "old";
    S2S::SyncTask2PObj(FullTask(), obj);
    EXPECT_EQ(3u, obj["status"].asUInt64());
    EXPECT_EQ("Nächtliche Sicherung", obj["name"].asString());

    PObject scalar("not a map");
    S2S::TaskInfo2PObj(TaskInfo(), scalar);
    ASSERT_TRUE(scalar.isMap());
    EXPECT_EQ("1111111", scalar["week_schd"].asString());
    EXPECT_TRUE(scalar["share_list"].isArray());
}

TEST(PObjectToTask, RoundTripLosesOnlyPeriodSecondsAndUnknownFlagBits) {
    PObject obj;
    const SyncTask original = FullTask();
    S2S::SyncTask2PObj(original, obj);
    SyncTask back;
    S2S::PObj2SyncTask(obj, back);
    ExpectSameTask(original, back);
    EXPECT_EQ(5400, back.GetInfo().GetSchedule().GetPeriodSeconds());
    EXPECT_EQ(5u, back.GetInfo().GetSyncInfo().GetSyncConfigFlag());
}

TEST(PObjectToTask, OnlyIdGivesADefaultInfo) {
    PObject obj;
    obj["id"] = 7ull;
    SyncTask task = FullTask();
    S2S::PObj2SyncTask(obj, task);
    EXPECT_EQ(7u, task.GetID());
    const TaskInfo& info = task.GetInfo();
    EXPECT_EQ("", info.GetName());
    EXPECT_TRUE(info.GetShareList().empty());
    EXPECT_EQ(0u, info.GetSyncInfo().GetSyncConfigFlag());
    EXPECT_EQ("", info.GetSyncInfo().GetPassword());
    EXPECT_EQ(0u, info.GetSyncInfo().GetMaxBandwidth());
    const Schedule& s = info.GetSchedule();
    EXPECT_EQ(S2S::SCHD_MANUAL, s.GetMode());
    EXPECT_EQ("1111111", s.GetWeekSchedule());
    EXPECT_EQ(2014, s.GetBeginYear());
    EXPECT_EQ(1, s.GetBeginMonth());
    EXPECT_EQ(1, s.GetBeginDay());
    EXPECT_EQ(0, s.GetStartHour());
    EXPECT_EQ(0, s.GetStartMinute());
    EXPECT_EQ(0, s.GetPeriodSeconds());
    EXPECT_EQ(0, s.GetRepeatTimesInDay());
}

TEST(PObjectToTask, MissingIdKeepsTheTargetId) {
    PObject obj;
    obj["name"] = "n";
    SyncTask task;
    task.SetID(99);
    S2S::PObj2SyncTask(obj, task);
    EXPECT_EQ(99u, task.GetID());
    EXPECT_EQ("n", task.GetInfo().GetName());
}

TEST(PObjectToTask, PeriodNeedsBothPartsAndIsReadBeforeTheRepeatCount) {
    auto read = [](PObject obj) {
        SyncTask task;
        S2S::PObj2SyncTask(obj, task);
        return std::make_pair(task.GetInfo().GetSchedule().GetPeriodSeconds(),
                              task.GetInfo().GetSchedule().GetRepeatTimesInDay());
    };
    PObject obj;
    obj["period_hour"] = 1;
    EXPECT_EQ(std::make_pair(0, 0), read(obj));
    obj["period_minute"] = 30;
    EXPECT_EQ(std::make_pair(5400, 0), read(obj));
    obj["repeat_times_in_day"] = 2;
    EXPECT_EQ(std::make_pair(5400, 2), read(obj));
    // A repeat count of 0 read last clears the period.
    obj["period_hour"] = 2;
    obj["period_minute"] = 0;
    obj["repeat_times_in_day"] = 0;
    EXPECT_EQ(std::make_pair(0, 0), read(obj));
    // A period of 0 clears the count, but the count is read afterwards.
    obj["period_hour"] = 0;
    obj["repeat_times_in_day"] = 4;
    EXPECT_EQ(std::make_pair(0, 4), read(obj));
    // Only the count: the period stays at its default 0.
    PObject count_only;
    count_only["repeat_times_in_day"] = 3;
    EXPECT_EQ(std::make_pair(0, 3), read(count_only));
}

TEST(PObjectToTask, PeriodTravelsInWholeMinutes) {
    SyncTask task;
    task.GetInfo().GetSchedule().SetPeriod(90);
    task.GetInfo().GetSchedule().SetRepeatTimesInDay(1);
    PObject obj;
    S2S::SyncTask2PObj(task, obj);
    EXPECT_EQ(0u, obj["period_hour"].asUInt64());
    EXPECT_EQ(1u, obj["period_minute"].asUInt64());
    SyncTask back;
    S2S::PObj2SyncTask(obj, back);
    EXPECT_EQ(60, back.GetInfo().GetSchedule().GetPeriodSeconds());
}

TEST(PObjectToTask, WeekScheduleIsNormalisedOnTheWayIn) {
    const std::pair<const char*, const char*> cases[] = {
        {"0000000", "1111111"}, {"01", "1111111"}, {"0a00000x", "0100000"}, {"1000001", "1000001"}};
    for (const auto& [sent, stored] : cases) {
        PObject obj;
        obj["week_schd"] = sent;
        SyncTask task;
        S2S::PObj2SyncTask(obj, task);
        EXPECT_EQ(stored, task.GetInfo().GetSchedule().GetWeekSchedule()) << sent;
    }
}

TEST(PObjectToTask, WrongKindsAreAbsorbed) {
    PObject obj;
    obj["id"] = "12";                 // a string where an integer belongs reads as 0
    obj["name"] = 42;                 // an integer where a string belongs reads as its text
    obj["share_list"] = "docs";       // not an array: no shares
    obj["compress"] = "no";           // a non-empty string is true
    obj["ssh"] = "";                  // an empty one is false
    obj["block"] = PObject::Array{};  // an empty array is false
    obj["ssh_port"] = "22";
    obj["schedule_mode"] = "weekly";  // the text is not understood: manual
    obj["week_schd"] = 1010101;       // read as the text "1010101"
    SyncTask task;
    task.SetID(5);
    S2S::PObj2SyncTask(obj, task);
    EXPECT_EQ(0u, task.GetID());
    EXPECT_EQ("42", task.GetInfo().GetName());
    EXPECT_TRUE(task.GetInfo().GetShareList().empty());
    EXPECT_TRUE(task.GetInfo().GetSyncInfo().UseCompression());
    EXPECT_FALSE(task.GetInfo().GetSyncInfo().UseSSH());
    EXPECT_FALSE(task.GetInfo().GetSyncInfo().UseBlockLevelSync());
    EXPECT_EQ(0u, task.GetInfo().GetSyncInfo().GetSSHPort());
    EXPECT_EQ(S2S::SCHD_MANUAL, task.GetInfo().GetSchedule().GetMode());
    EXPECT_EQ("1010101", task.GetInfo().GetSchedule().GetWeekSchedule());
}

TEST(PObjectToSyncInfo, MissingKeysLeaveFieldsAlone) {
    SyncInfo info;
    info.SetSyncConfigFlag(0x13);  // compression, SSH and an unknown bit
    info.SetUser("keep");
    info.SetPassword("keep too");
    info.SetMaxBandwidth(10);
    PObject obj;
    obj["server_ip"] = "198.51.100.1";
    obj["ssh"] = false;
    obj["block"] = true;
    S2S::PObj2SyncInfo(obj, info);
    EXPECT_EQ("keep", info.GetUser());
    EXPECT_EQ("keep too", info.GetPassword());
    EXPECT_EQ("198.51.100.1", info.GetServerIP());
    EXPECT_EQ(10u, info.GetMaxBandwidth());
    EXPECT_EQ(0x15u, info.GetSyncConfigFlag());  // SSH cleared, block set, the rest kept

    S2S::PObj2SyncInfo(PObject(), info);  // not a map: nothing to read
    EXPECT_EQ("keep", info.GetUser());
}

TEST(PObjectToTask, StatusAndResultReadAsZeroWhenMissing) {
    PObject obj;
    S2S::SyncTask2PObj(FullTask(), obj);
    SyncTask task;
    S2S::TASK_STATUS status = static_cast<S2S::TASK_STATUS>(9);
    S2S::TASK_RESULT result = static_cast<S2S::TASK_RESULT>(9);
    S2S::PObj2SyncTask(obj, task, status, result);
    EXPECT_EQ(0, static_cast<int>(status));
    EXPECT_EQ(0, static_cast<int>(result));
    obj["status"] = 3;
    obj["sync_result"] = -2;
    S2S::PObj2SyncTask(obj, task, status, result);
    EXPECT_EQ(3, static_cast<int>(status));
    EXPECT_EQ(-2, static_cast<int>(result));
    ExpectSameTask(FullTask(), task);
}

// A front end sends a task to a daemon in another process over a local TCP connection; the daemon
// turns the map back into a task, writes it out again next to its own status keys and replies.
// The task that comes back has lost exactly the period's seconds and the unknown flag bits.
TEST(TaskOverSocket, SurvivesTheTripToAnotherProcessAndBack) {
    s2s_test::LogCapture log;
    S2S::IPCListener listener;
    listener.setTimeout(timeval{30, 0});
    const int port = listener.prepare(0);
    ASSERT_GT(port, 0);

    const pid_t child = fork();
    ASSERT_NE(-1, child);
    if (child == 0) {
        // The daemon. No gtest assertions here: the exit code says what went wrong.
        if (!listener.isReady()) {
            _exit(10);
        }
        S2S::IPCSender peer;
        int fd = listener.accept();
        if (fd < 0 || peer.assign(fd) != 0) {
            _exit(11);
        }
        PObject request;
        if (peer.recv(request) != 0) {
            _exit(12);
        }
        SyncTask task;
        S2S::PObj2SyncTask(request, task);
        PObject reply;
        reply["status"] = 2;
        reply["sync_result"] = -7;
        S2S::SyncTask2PObj(task, reply);
        if (peer.send(reply) != 0) {
            _exit(13);
        }
        peer.close();
        _exit(0);
    }
    // The listener stays open here until the daemon is done: closing it shuts the shared socket
    // down for the child too.

    const SyncTask original = FullTask();
    PObject request;
    S2S::SyncTask2PObj(original, request);
    PObject reply;
    S2S::IPCSender sender;
    ASSERT_EQ(0, sender.connect(port));
    EXPECT_EQ(0, sender.send(request, true, reply)) << log.Text();
    sender.close();

    int status = 0;
    ASSERT_EQ(child, waitpid(child, &status, 0));
    ASSERT_TRUE(WIFEXITED(status));
    ASSERT_EQ(0, WEXITSTATUS(status)) << log.Text();

    SyncTask back;
    S2S::TASK_STATUS task_status{};
    S2S::TASK_RESULT task_result{};
    S2S::PObj2SyncTask(reply, back, task_status, task_result);
    ExpectSameTask(original, back);
    EXPECT_EQ(5400, back.GetInfo().GetSchedule().GetPeriodSeconds());
    EXPECT_EQ(5u, back.GetInfo().GetSyncInfo().GetSyncConfigFlag());
    EXPECT_EQ(2, static_cast<int>(task_status));
    EXPECT_EQ(-7, static_cast<int>(task_result));
}

}  // namespace
