// The text dumps byte for byte: labels and dot padding, line order, the missing line end after a
// schedule, the '0' fill left on the stream, and no password anywhere.
#include <gtest/gtest.h>

#include <iomanip>
#include <sstream>
#include <string>

#include "s2s_sync_obj.h"

namespace {

using S2S::Schedule;
using S2S::SyncInfo;
using S2S::SyncTask;
using S2S::TaskInfo;

template <typename T>
std::string Dump(const T& value) {
    std::ostringstream out;
    out << value;
    return out.str();
}

TEST(Dump, Share) {
    S2S::Share share;
    share.SetID(18446744073709551615ull);
    share.SetName("docs");
    EXPECT_EQ(
        "id: ... 18446744073709551615\n"
        "name: . docs\n",
        Dump(share));
}

TEST(Dump, Event) {
    S2S::Event event;
    event.SetID(12);
    event.SetShareName("media");
    event.SetRelativePath("a/b.txt");
    event.SetStatus(static_cast<S2S::EVENT_STATUS>(-2));
    EXPECT_EQ(
        "id: ............ 12\n"
        "share_name: .... media\n"
        "relative_path: . /a/b.txt\n"
        "status: ........ -2\n",
        Dump(event));
}

SyncInfo Server(unsigned flag) {
    SyncInfo info;
    info.SetSyncConfigFlag(flag);
    info.SetUser("backup");
    info.SetPassword("TopSecret!");
    info.SetServerIP("192.0.2.7");
    info.SetServerName("nas");
    info.SetSSHPort(22);
    info.SetMaxBandwidth(4294967295u);
    return info;
}

TEST(Dump, SyncInfoShowsTheFlagsAndNeverThePassword) {
    EXPECT_EQ(
        "user: ................. backup\n"
        "server_ip: ............ 192.0.2.7\n"
        "server_name: .......... nas\n"
        "use compression: ...... yes\n"
        "use block level sync: . yes\n"
        "use ssh: .............. no\n"
        "ssh port: ............. 22\n"
        "max bandwidth: ........ 4294967295\n",
        Dump(Server(5)));
    std::string ssh_only = Dump(Server(2));
    EXPECT_NE(std::string::npos, ssh_only.find("use compression: ...... no\n"));
    EXPECT_NE(std::string::npos, ssh_only.find("use block level sync: . no\n"));
    EXPECT_NE(std::string::npos, ssh_only.find("use ssh: .............. yes\n"));
}

TEST(Dump, ScheduleEndsWithoutNewlineAndLeavesZeroFill) {
    Schedule s;
    s.SetMode(S2S::SCHD_MONTHLY);
    s.SetStartHour(8);
    s.SetStartMinute(5);
    s.SetPeriod(5400);
    s.SetRepeatTimesInDay(3);
    s.SetWeekSchedule("0101010");
    std::ostringstream out;
    out << s;
    EXPECT_EQ(
        "mode: ................ monthly\n"
        "week_schd: ............. 0101010\n"
        "schedule_begin: ...... 2014-01-01 08:05:00\n"
        "period: .............. 01:30\n"
        "repeat_times_in_day: . 3\n"
        "last sync in day: .... 12:35",
        out.str());
    EXPECT_EQ('0', out.fill());
    out << "|" << std::setw(4) << 7;
    EXPECT_EQ("|0007", out.str().substr(out.str().size() - 5));
}

TEST(Dump, ScheduleDefaultsAndOddValues) {
    EXPECT_EQ(
        "mode: ................ manual\n"
        "week_schd: ............. 1111111\n"
        "schedule_begin: ...... 2014-01-01 00:00:00\n"
        "period: .............. 00:00\n"
        "repeat_times_in_day: . 0\n"
        "last sync in day: .... 00:00",
        Dump(Schedule()));

    // Raw fields, as given: nothing is normalised for display.
    Schedule s;
    s.SetMode(static_cast<S2S::SCHD_MODE>(9));
    s.SetBeginYear(999);
    s.SetBeginMonth(13);
    s.SetBeginDay(31);
    s.SetStartHour(23);
    s.SetStartMinute(59);
    s.SetPeriod(90061);  // 25 h 1 min 1 s
    s.SetRepeatTimesInDay(1);
    EXPECT_EQ(
        "mode: ................ weekly\n"
        "week_schd: ............. 1111111\n"
        "schedule_begin: ...... 999-13-31 23:59:00\n"
        "period: .............. 25:01\n"
        "repeat_times_in_day: . 1\n"
        "last sync in day: .... 49:00",
        Dump(s));
}

TaskInfo Task() {
    TaskInfo info;
    info.SetName("nightly");
    info.SetShareList({"a", "b"});
    info.SetSyncInfo(Server(2));
    info.GetSchedule().SetMode(S2S::SCHD_WEEKLY);
    info.GetSchedule().SetStartHour(23);
    return info;
}

const char kTaskInfoDump[] =
    "name: ................. nightly\n"
    "share_list: ........... a,b,\n"
    "<Server Info>\n"
    "user: ................. backup\n"
    "server_ip: ............ 192.0.2.7\n"
    "server_name: .......... nas\n"
    "use compression: ...... no\n"
    "use block level sync: . no\n"
    "use ssh: .............. yes\n"
    "ssh port: ............. 22\n"
    "max bandwidth: ........ 4294967295\n"
    "<Schedule>\n"
    "mode: ................ weekly\n"
    "week_schd: ............. 1111111\n"
    "schedule_begin: ...... 2014-01-01 23:00:00\n"
    "period: .............. 00:00\n"
    "repeat_times_in_day: . 0\n"
    "last sync in day: .... 23:00";

TEST(Dump, TaskInfoAndSyncTask) {
    EXPECT_EQ(kTaskInfoDump, Dump(Task()));

    SyncTask task;
    task.SetID(77);
    task.SetInfo(Task());
    EXPECT_EQ(std::string("id: ................... 77\n\n") + kTaskInfoDump, Dump(task));

    TaskInfo empty = Task();
    empty.SetShareList({});
    EXPECT_NE(std::string::npos, Dump(empty).find("share_list: ........... \n<Server Info>\n"));
}

TEST(Dump, NoPasswordInAnyDump) {
    SyncTask task;
    task.SetInfo(Task());
    for (const std::string& text : {Dump(Server(7)), Dump(Task()), Dump(task)}) {
        EXPECT_EQ(std::string::npos, text.find("TopSecret")) << text;
        EXPECT_EQ(std::string::npos, text.find("pass")) << text;
        EXPECT_EQ(std::string::npos, text.find("pswd")) << text;
    }
}

}  // namespace
