// The sync model's value classes: event paths, the config flag bits, SyncInfo and TaskInfo
// validation (rules in order, exact NOTE lines, shares checked against a real share registry and
// volume table under S2S_ROOT), and task copies.
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>

#include "s2s_platform.h"
#include "s2s_sync_obj.h"
#include "sync/sync_test_util.h"

namespace {

using S2S::Event;
using S2S::Schedule;
using S2S::Share;
using S2S::SyncInfo;
using S2S::SyncTask;
using S2S::TaskInfo;
using LogCapture = s2s_test::StampFreeLogCapture;
using s2s_test::ScopedEnv;
using s2s_test::ScopedTZ;
using s2s_test::TempDir;

TEST(ShareAndEvent, DefaultsAndAccessors) {
    Share share;
    EXPECT_EQ(0u, share.GetID());
    EXPECT_EQ("", share.GetName());
    share.SetID(0xFFFFFFFFFFFFFFFFull);
    share.SetName("docs");
    EXPECT_EQ(0xFFFFFFFFFFFFFFFFull, share.GetID());
    EXPECT_EQ("docs", share.GetName());

    Event event;
    EXPECT_EQ(0, static_cast<int>(event.GetStatus()));
    EXPECT_EQ(0u, event.GetID());
    EXPECT_EQ("", event.GetShareName());
    EXPECT_EQ("", event.GetRelativePath());  // "/" only once set
    event.SetStatus(static_cast<S2S::EVENT_STATUS>(-3));
    EXPECT_EQ(-3, static_cast<int>(event.GetStatus()));
}

TEST(ShareAndEvent, RelativePathGetsOneLeadingSlashAndNothingElse) {
    Event event;
    const std::pair<const char*, const char*> cases[] = {
        {"a/b", "/a/b"},   {"", "/"},  {"/a", "/a"},  {"//a//b/", "//a//b/"},
        {"../x", "/../x"}, {"/", "/"}, {" a", "/ a"}, {"a/", "/a/"},
    };
    for (const auto& [given, stored] : cases) {
        event.SetRelativePath(given);
        EXPECT_EQ(stored, event.GetRelativePath()) << "'" << given << "'";
    }
}

TEST(SyncInfoFlags, EachSetterTouchesOnlyItsOwnBit) {
    SyncInfo info;
    EXPECT_EQ(0u, info.GetSyncConfigFlag());
    info.SetSyncConfigFlag(7);
    info.SetCompression(false);
    EXPECT_EQ(6u, info.GetSyncConfigFlag());
    info.SetSSH(false);
    EXPECT_EQ(4u, info.GetSyncConfigFlag());
    info.SetBlockLevelSync(false);
    EXPECT_EQ(0u, info.GetSyncConfigFlag());
    info.SetBlockLevelSync(true);
    info.SetBlockLevelSync(true);
    EXPECT_EQ(4u, info.GetSyncConfigFlag());

    // Unknown bits are kept and ignored.
    info.SetSyncConfigFlag(8);
    EXPECT_FALSE(info.UseCompression());
    EXPECT_FALSE(info.UseSSH());
    EXPECT_FALSE(info.UseBlockLevelSync());
    EXPECT_EQ(8u, info.GetSyncConfigFlag());
    info.SetSSH(true);
    EXPECT_EQ(10u, info.GetSyncConfigFlag());
    EXPECT_TRUE(info.UseSSH());
    info.SetSyncConfigFlag(0xFFFFFFFFu);
    info.SetCompression(false);
    EXPECT_EQ(0xFFFFFFFEu, info.GetSyncConfigFlag());
    EXPECT_TRUE(info.UseSSH());
    EXPECT_TRUE(info.UseBlockLevelSync());
}

SyncInfo ValidServer() {
    SyncInfo info;
    info.SetServerIP("192.0.2.7");
    info.SetUser("backup");
    return info;
}

TEST(SyncInfoValidate, RulesInOrderWithTheirLines) {
    SyncInfo info = ValidServer();
    {
        LogCapture log;
        EXPECT_TRUE(info.Validate());
        info.SetServerIP("");
        info.SetServerName("nas.example");  // one of the two is enough
        EXPECT_TRUE(info.Validate());
        info.SetSSHPort(65535);
        EXPECT_TRUE(info.Validate());
        info.SetSSHPort(0);    // "not set"
        info.SetPassword("");  // an empty password is fine
        EXPECT_TRUE(info.Validate());
        EXPECT_EQ("", log.Text());
    }
    struct Case {
        const char* what;
        SyncInfo info;
        std::string log;
    };
    auto with = [](auto change) {
        SyncInfo s = ValidServer();
        change(s);
        return s;
    };
    const Case cases[] = {
        {"no server", with([](SyncInfo& s) { s.SetServerIP(""); }),
         "[NOTE] s2s_sync_obj.cpp(610): Empty server ip and name\n"},
        {"no server and no user", with([](SyncInfo& s) {
             s.SetServerIP("");
             s.SetUser("");
         }),
         "[NOTE] s2s_sync_obj.cpp(610): Empty server ip and name\n"},
        {"no user", with([](SyncInfo& s) { s.SetUser(""); }),
         "[NOTE] s2s_sync_obj.cpp(615): Empty user name ''\n"},
        {"no user, bad port", with([](SyncInfo& s) {
             s.SetUser("");
             s.SetSSHPort(70000);
         }),
         "[NOTE] s2s_sync_obj.cpp(615): Empty user name ''\n"},
        {"port 65536", with([](SyncInfo& s) { s.SetSSHPort(65536); }),
         "[NOTE] s2s_sync_obj.cpp(620): Invalid SSH port '65536'\n"},
        {"bad port without SSH in use", with([](SyncInfo& s) {
             s.SetSSH(false);
             s.SetSSHPort(4294967295u);
         }),
         "[NOTE] s2s_sync_obj.cpp(620): Invalid SSH port '4294967295'\n"},
    };
    for (const Case& c : cases) {
        LogCapture log;
        EXPECT_FALSE(c.info.Validate()) << c.what;
        EXPECT_EQ(c.log, log.Text()) << c.what;
    }
}

// A share registry and a volume table under a private S2S_ROOT: shares on an internal volume
// are valid, those on an external one are not.
class TaskValidate : public ::testing::Test {
  protected:
    TaskValidate() : env_("S2S_ROOT", root_.path().c_str()), tz_("UTC") {
        std::string internal = root_ / "volume1";
        std::string external = root_ / "usbshare1";
        EXPECT_EQ(0, system(("mkdir -p '" + internal + "/docs' '" + internal + "/media' '" +
                             external + "/photos'")
                                .c_str()));
        std::string host_conf = S2SPath(S2S_PATH_HOST_CONF);
        EXPECT_EQ(0,
                  system(("mkdir -p '" + host_conf.substr(0, host_conf.rfind('/')) + "'").c_str()));
        s2s_test::WriteFile(host_conf, "[volumes]\n\t" + internal + "=\"internal\"\n\t" + external +
                                           "=\"external\"\n");
        AddShare("docs", internal + "/docs");
        AddShare("media", internal + "/media");
        AddShare("photos", external + "/photos");
    }

    static void AddShare(const char* name, const std::string& path) {
        VLIBSzHash* attrs = VLIBCSzHashAlloc(4);
        ASSERT_NE(nullptr, attrs);
        ASSERT_EQ(0, VLIBCSzHashSetValue(&attrs, "path", path.c_str()));
        EXPECT_EQ(0, VURNShareSet(name, attrs));
        VLIBCSzHashFree(attrs);
    }

    static TaskInfo ValidTask() {
        TaskInfo task;
        task.SetName("nightly");
        task.SetShareList({"docs", "media"});
        task.SetSyncInfo(ValidServer());
        return task;
    }

    TempDir root_;
    ScopedEnv env_;
    ScopedTZ tz_;
};

TEST_F(TaskValidate, ValidTaskPassesSilently) {
    LogCapture log;
    EXPECT_TRUE(ValidTask().Validate());
    EXPECT_EQ("", log.Text());
}

TEST_F(TaskValidate, RulesInOrderWithTheirLines) {
    struct Case {
        const char* what;
        TaskInfo task;
        std::string log;
    };
    auto with = [](auto change) {
        TaskInfo t = ValidTask();
        change(t);
        return t;
    };
    const Case cases[] = {
        // The server info comes first, then the schedule, then the task's own fields.
        {"bad server info and no name", with([](TaskInfo& t) {
             SyncInfo info;
             t.SetSyncInfo(info);
             t.SetName("");
         }),
         "[NOTE] s2s_sync_obj.cpp(610): Empty server ip and name\n"},
        {"bad schedule and no name", with([](TaskInfo& t) {
             t.GetSchedule().SetStartHour(24);
             t.SetName("");
         }),
         "[NOTE] s2s_sync_obj.cpp(325): Invalid begin hour\n"},
        // These two lines have no newline of their own.
        {"no name", with([](TaskInfo& t) { t.SetName(""); }),
         "[NOTE] s2s_sync_obj.cpp(756): Empty task name"},
        {"no shares", with([](TaskInfo& t) { t.SetShareList({}); }),
         "[NOTE] s2s_sync_obj.cpp(761): Empty share list"},
        {"second share on an external volume", with([](TaskInfo& t) {
             t.SetShareList({"docs", "photos", "missing"});
         }),
         "[NOTE] s2s_sync_obj.cpp(770): Share 'photos' is not valid\n"},
    };
    for (const Case& c : cases) {
        LogCapture log;
        EXPECT_FALSE(c.task.Validate()) << c.what;
        EXPECT_EQ(c.log, log.Text()) << c.what;
    }
}

TEST_F(TaskValidate, UnknownShareIsInvalidAfterTheHostSaysWhy) {
    LogCapture log;
    TaskInfo task = ValidTask();
    task.SetShareList({"docs", "nosuch", "photos"});
    EXPECT_FALSE(task.Validate());
    std::string text = log.Text();
    // The host reports its own failure; the task names the share, and stops there.
    EXPECT_NE(std::string::npos, text.find("Fail to get share 'nosuch'")) << text;
    EXPECT_NE(std::string::npos,
              text.find("[NOTE] s2s_sync_obj.cpp(770): Share 'nosuch' is not valid\n"))
        << text;
    EXPECT_EQ(std::string::npos, text.find("photos")) << text;
}

TEST_F(TaskValidate, ValidationChangesNothing) {
    TaskInfo task = ValidTask();
    task.SetShareList({"photos"});
    task.GetSchedule().SetPeriod(90);
    task.GetSchedule().SetRepeatTimesInDay(2);
    LogCapture log;
    EXPECT_FALSE(task.Validate());
    EXPECT_EQ(std::list<std::string>({"photos"}), task.GetShareList());
    EXPECT_EQ(90, task.GetSchedule().GetPeriodSeconds());
    EXPECT_EQ(2, task.GetSchedule().GetRepeatTimesInDay());
}

TEST(SyncTaskCopy, SetInfoCopiesEveryFieldAndCopiesAreIndependent) {
    TaskInfo info;
    info.SetName("weekly docs");
    info.SetShareList({"b", "a", "b"});
    SyncInfo server;
    server.SetSyncConfigFlag(0x85);
    server.SetSSHPort(2222);
    server.SetMaxBandwidth(1000);
    server.SetUser("u");
    server.SetPassword("p");
    server.SetServerIP("10.0.0.1");
    server.SetServerName("peer");
    info.SetSyncInfo(server);
    Schedule schedule;
    schedule.SetMode(S2S::SCHD_MONTHLY);
    schedule.SetPeriod(3661);
    schedule.SetRepeatTimesInDay(5);
    schedule.SetWeekSchedule("0110000");
    schedule.SetBeginYear(2030);
    schedule.SetBeginMonth(12);
    schedule.SetBeginDay(31);
    schedule.SetStartHour(1);
    schedule.SetStartMinute(2);
    info.SetSchedule(schedule);

    SyncTask task;
    EXPECT_EQ(0u, task.GetID());
    task.SetID(42);
    task.SetInfo(info);
    info.SetName("changed");
    info.GetSchedule().SetStartHour(9);

    const TaskInfo& copy = task.GetInfo();
    EXPECT_EQ("weekly docs", copy.GetName());
    EXPECT_EQ(std::list<std::string>({"b", "a", "b"}), copy.GetShareList());
    EXPECT_EQ(0x85u, copy.GetSyncInfo().GetSyncConfigFlag());
    EXPECT_EQ(2222u, copy.GetSyncInfo().GetSSHPort());
    EXPECT_EQ(1000u, copy.GetSyncInfo().GetMaxBandwidth());
    EXPECT_EQ("u", copy.GetSyncInfo().GetUser());
    EXPECT_EQ("p", copy.GetSyncInfo().GetPassword());
    EXPECT_EQ("10.0.0.1", copy.GetSyncInfo().GetServerIP());
    EXPECT_EQ("peer", copy.GetSyncInfo().GetServerName());
    const Schedule& s = copy.GetSchedule();
    EXPECT_EQ(S2S::SCHD_MONTHLY, s.GetMode());
    EXPECT_EQ(3661, s.GetPeriodSeconds());
    EXPECT_EQ(5, s.GetRepeatTimesInDay());
    EXPECT_EQ("0110000", s.GetWeekSchedule());
    EXPECT_EQ(2030, s.GetBeginYear());
    EXPECT_EQ(12, s.GetBeginMonth());
    EXPECT_EQ(31, s.GetBeginDay());
    EXPECT_EQ(1, s.GetStartHour());
    EXPECT_EQ(2, s.GetStartMinute());

    // The non-const accessors edit in place.
    task.GetInfo().GetSchedule().SetStartMinute(30);
    EXPECT_EQ(30, task.GetInfo().GetSchedule().GetStartMinute());
    EXPECT_EQ(42u, task.GetID());
}

}  // namespace
