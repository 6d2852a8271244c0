// The two outside forms of the sync model. The text dumps, one golden dump per type (labels, dot
// padding, line order, no line end after a schedule and its '0' fill left on the stream, never
// the password). The PObject map a task becomes: one golden dump (key set, kinds, sign
// extension), the round trip with only the documented losses, and reading: defaults and presence
// tests, the period/repeat coupling, wrong kinds absorbed.
#include <gtest/gtest.h>

#include <iomanip>
#include <sstream>
#include <string>

#include "s2s_pobject.h"
#include "s2s_sync_obj.h"

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

SyncTask Read(const PObject& obj, SyncTask task = SyncTask()) {
    S2S::PObj2SyncTask(obj, task);
    return task;
}

// The task's dump (which leaves out the password) plus the password.
std::string Text(const SyncTask& task) {
    std::ostringstream out;
    out << task << "\npassword: " << task.GetInfo().GetSyncInfo().GetPassword();
    return out.str();
}

TEST(Dump, ShareAndEvent) {
    S2S::Share share;
    share.SetID(18446744073709551615ull);
    share.SetName("docs");
    S2S::Event event;
    event.SetID(12);
    event.SetShareName("media");
    event.SetRelativePath("a/b.txt");
    event.SetStatus(static_cast<S2S::EVENT_STATUS>(-2));
    std::ostringstream out;
    out << share << event;
    EXPECT_EQ(
        "id: ... 18446744073709551615\n"
        "name: . docs\n"
        "id: ............ 12\n"
        "share_name: .... media\n"
        "relative_path: . /a/b.txt\n"
        "status: ........ -2\n",
        out.str());
}

// A task holds every other kind: its dump shows the task info, the server info and the schedule.
TEST(Dump, SyncTaskWithItsServerAndScheduleAndNoPassword) {
    std::ostringstream out;
    out << FullTask();
    EXPECT_EQ(
        "id: ................... 18364758544493064720\n"
        "\n"
        "name: ................. Nächtliche Sicherung\n"
        "share_list: ........... docs,media,a share,\n"
        "<Server Info>\n"
        "user: ................. backup\n"
        "server_ip: ............ 192.0.2.7\n"
        "server_name: .......... nas.example\n"
        "use compression: ...... yes\n"
        "use block level sync: . yes\n"
        "use ssh: .............. no\n"
        "ssh port: ............. 65535\n"
        "max bandwidth: ........ 4294967295\n"
        "<Schedule>\n"
        "mode: ................ weekly\n"
        "week_schd: ............. 0101011\n"
        "schedule_begin: ...... 2024-02-29 07:45:00\n"
        "period: .............. 01:30\n"
        "repeat_times_in_day: . 3\n"
        "last sync in day: .... 12:16",
        out.str());
    EXPECT_EQ('0', out.fill());
    out << "|" << std::setw(4) << 7;
    EXPECT_EQ("|0007", out.str().substr(out.str().size() - 5));
    EXPECT_EQ(std::string::npos, out.str().find("s3cr3t"));
}

TEST(TaskToPObject, GoldenMapWithTheKeysAndKindsTheDaemonReads) {
    PObject obj;
    obj["status"] = 3;  // the target keeps its own keys
    obj["name"] = "old";
    S2S::SyncTask2PObj(FullTask(), obj);
    EXPECT_EQ(
        "{\"block\": 1, \"compress\": 1, \"id\": 18364758544493064720, "
        "\"max_bandwidth\": 4294967295, \"name\": \"Nächtliche Sicherung\", \"period_hour\": 1, "
        "\"period_minute\": 30, \"pswd\": \"s3cr3t \"quoted\"\", \"repeat_times_in_day\": 3, "
        "\"schedule_begin_day\": 29, \"schedule_begin_hour\": 7, \"schedule_begin_min\": 45, "
        "\"schedule_begin_month\": 2, \"schedule_begin_year\": 2024, \"schedule_mode\": 2, "
        "\"server_ip\": \"192.0.2.7\", \"server_name\": \"nas.example\", "
        "\"share_list\": [\"docs\", \"media\", \"a share\"], \"ssh\": 0, \"ssh_port\": 65535, "
        "\"status\": 3, \"user\": \"backup\", \"week_schd\": \"0101011\"}",
        obj.toString());
    PObject info_only("not a map");
    S2S::TaskInfo2PObj(FullTask().GetInfo(), info_only);
    EXPECT_FALSE(info_only.hasMember("id"));
    EXPECT_EQ(obj.asMap().size() - 2, info_only.asMap().size());

    SyncTask odd;  // signed fields are sign-extended and come back
    odd.GetInfo().GetSchedule().SetBeginDay(-5);
    odd.GetInfo().GetSchedule().SetMode(static_cast<S2S::SCHD_MODE>(-1));
    S2S::SyncTask2PObj(odd, obj);
    EXPECT_EQ(0xFFFFFFFFFFFFFFFBull, obj["schedule_begin_day"].asUInt64());
    EXPECT_EQ(-5, Read(obj).GetInfo().GetSchedule().GetBeginDay());
    EXPECT_EQ(-1, static_cast<int>(Read(obj).GetInfo().GetSchedule().GetMode()));
}

TEST(PObjectToTask, RoundTripLosesOnlyPeriodSecondsAndUnknownFlagBits) {
    SyncTask want = FullTask();
    PObject obj;
    S2S::SyncTask2PObj(want, obj);
    want.GetInfo().GetSchedule().SetPeriod(5400);
    SyncInfo server = want.GetInfo().GetSyncInfo();
    server.SetSyncConfigFlag(5);
    want.GetInfo().SetSyncInfo(server);
    EXPECT_EQ(Text(want), Text(Read(obj)));
}

TEST(PObjectToTask, MissingKeysGiveDefaultsButKeepTheTargetIdAndStatus) {
    PObject obj;
    obj["id"] = 7ull;
    SyncTask keep;
    keep.SetID(7);
    EXPECT_EQ(Text(keep), Text(Read(obj, FullTask())));
    PObject no_id;
    no_id["name"] = "n";
    EXPECT_EQ(7u, Read(no_id, keep).GetID());
    S2S::TASK_STATUS status = static_cast<S2S::TASK_STATUS>(9);
    S2S::TASK_RESULT result = static_cast<S2S::TASK_RESULT>(9);
    S2S::PObj2SyncTask(obj, keep, status, result);
    EXPECT_EQ(0, status + result);
    obj["status"] = 3;
    obj["sync_result"] = -2;
    S2S::PObj2SyncTask(obj, keep, status, result);
    EXPECT_EQ(3, static_cast<int>(status));
    EXPECT_EQ(-2, static_cast<int>(result));
    SyncInfo info;  // the server part alone: absent keys leave fields alone
    info.SetSyncConfigFlag(0x13);
    info.SetUser("keep");
    PObject server;
    server["ssh"] = false;
    server["block"] = true;
    S2S::PObj2SyncInfo(server, info);
    EXPECT_EQ("keep", info.GetUser());
    EXPECT_EQ(0x15u, info.GetSyncConfigFlag());  // SSH cleared, block set, the rest kept
}

TEST(PObjectToTask, PeriodNeedsBothPartsAndIsReadBeforeTheRepeatCount) {
    struct Case {
        long hour, minute, repeat;  // -1: absent
        long period, repeats;
    };
    const Case cases[] = {
        {1, -1, -1, 0, 0}, {1, 30, -1, 5400, 0}, {1, 30, 2, 5400, 2},
        {0, 1, 1, 60, 1},  {2, 0, 0, 0, 0},  // a repeat count of 0 read last clears the period
        {0, 0, 4, 0, 4},  // a period of 0 clears the count, but the count is read afterwards
        {-1, -1, 3, 0, 3},
    };
    for (const Case& c : cases) {
        PObject obj;
        for (auto [key, value] : {std::pair<const char*, long>{"period_hour", c.hour},
                                  {"period_minute", c.minute},
                                  {"repeat_times_in_day", c.repeat}}) {
            if (value >= 0) {
                obj[key] = static_cast<unsigned long long>(value);
            }
        }
        const Schedule s = Read(obj).GetInfo().GetSchedule();
        EXPECT_EQ(c.period, s.GetPeriodSeconds()) << obj.toString();
        EXPECT_EQ(c.repeats, s.GetRepeatTimesInDay()) << obj.toString();
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
    SyncTask want;
    want.GetInfo().SetName("42");
    SyncInfo compress;
    compress.SetCompression(true);
    want.GetInfo().SetSyncInfo(compress);
    want.GetInfo().GetSchedule().SetWeekSchedule("1010101");
    SyncTask five;
    five.SetID(5);
    EXPECT_EQ(Text(want), Text(Read(obj, five)));
    obj["week_schd"] = "0a00000x";  // normalised on the way in
    EXPECT_EQ("0100000", Read(obj).GetInfo().GetSchedule().GetWeekSchedule());
}

}  // namespace
