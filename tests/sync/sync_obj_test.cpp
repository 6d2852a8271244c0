// The sync model's value classes: event paths, the config flag bits, and SyncInfo and TaskInfo
// validation (rules in order with their NOTE lines, shares checked against a real share registry
// and volume table under S2S_ROOT).
#include <gtest/gtest.h>

#include <string>

#include "s2s_platform.h"
#include "s2s_sync_obj.h"
#include "sync/sync_test_util.h"

namespace {

using S2S::SyncInfo;
using S2S::TaskInfo;
using s2s_test::LogCapture;
using s2s_test::Logged;

TEST(Event, RelativePathGetsOneLeadingSlashAndNothingElse) {
    S2S::Event event;
    const std::pair<const char*, const char*> cases[] = {
        {"", "/"}, {"/a", "/a"}, {"//a//b/", "//a//b/"}, {"../x", "/../x"}, {" a", "/ a"}};
    for (const auto& [given, stored] : cases) {
        event.SetRelativePath(given);
        EXPECT_EQ(stored, event.GetRelativePath()) << "'" << given << "'";
    }
}

TEST(SyncInfoFlags, EachSetterTouchesOnlyItsOwnBitAndUnknownBitsStay) {
    SyncInfo info;
    info.SetSyncConfigFlag(0xFFFFFFFFu);
    info.SetCompression(false);
    info.SetSSH(false);
    EXPECT_EQ(0xFFFFFFFCu, info.GetSyncConfigFlag());
    info.SetSyncConfigFlag(8);
    EXPECT_FALSE(info.UseCompression() || info.UseSSH() || info.UseBlockLevelSync());
    info.SetBlockLevelSync(true);
    info.SetBlockLevelSync(true);
    EXPECT_EQ(12u, info.GetSyncConfigFlag());
}

SyncInfo ValidServer() {
    SyncInfo info;
    info.SetServerIP("192.0.2.7");
    info.SetUser("backup");
    return info;
}

// A share registry and a volume table under a private S2S_ROOT: shares on an internal volume
// are valid, those on an external one are not.
class Validate : public ::testing::Test {
  protected:
    Validate() {
        const std::string internal = root_ / "volume1", external = root_ / "usbshare1";
        const std::string host_conf = S2SPath(S2S_PATH_HOST_CONF);
        s2s_test::MakeDirs(host_conf.substr(0, host_conf.rfind('/')));
        s2s_test::WriteFile(host_conf, "[volumes]\n\t" + internal + "=\"internal\"\n\t" + external +
                                           "=\"external\"\n");
        for (const auto& [name, path] : {std::pair<const char*, std::string>{"docs", internal},
                                         {"media", internal},
                                         {"photos", external}}) {
            s2s_test::MakeDirs(path + "/" + name);
            s2s_test::Table attrs{{"path", path + "/" + name}};
            EXPECT_EQ(0, VURNShareSet(name, attrs.get()));
        }
    }

    static TaskInfo ValidTask() {
        TaskInfo task;
        task.SetName("nightly");
        task.SetShareList({"docs", "media"});
        task.SetSyncInfo(ValidServer());
        return task;
    }

    s2s_test::TempDir root_;
    s2s_test::ScopedEnv env_{"S2S_ROOT", root_.path().c_str()};
    s2s_test::ScopedTZ tz_{"UTC"};
};

TEST_F(Validate, SyncInfoRulesInOrderWithTheirLines) {
    {
        LogCapture log;
        SyncInfo info = ValidServer();
        info.SetServerIP("");
        info.SetServerName("nas.example");  // one of the two is enough
        info.SetSSHPort(65535);             // 0 ("not set") passes too; no password is fine
        EXPECT_TRUE(info.Validate() && ValidServer().Validate() && ValidTask().Validate());
        EXPECT_EQ("", log.Text());
    }
    struct Case {
        const char *ip, *user;
        unsigned port;
        std::string line;
    };
    const std::string p = "[NOTE] s2s_sync_obj.cpp: ";
    for (const Case& c :
         {Case{"", "", 22, p + "Empty server ip and name\n"},
          Case{"192.0.2.7", "", 70000, p + "Empty user name ''\n"},
          Case{"192.0.2.7", "backup", 65536, p + "Invalid SSH port '65536'\n"},
          // checked even without SSH in use
          Case{"192.0.2.7", "backup", 4294967295u, p + "Invalid SSH port '4294967295'\n"}}) {
        SyncInfo info;
        info.SetServerIP(c.ip);
        info.SetUser(c.user);
        info.SetSSHPort(c.port);
        LogCapture log;
        EXPECT_FALSE(info.Validate()) << c.line;
        EXPECT_EQ(c.line, Logged(log));
    }
}

TEST_F(Validate, TaskRulesInOrderWithTheirLinesAndNothingChanges) {
    auto with = [](auto change) {
        TaskInfo t = ValidTask();
        change(t);
        return t;
    };
    const std::string p = "[NOTE] s2s_sync_obj.cpp: ";
    const std::pair<TaskInfo, std::string> cases[] = {
        // The server info comes first, then the schedule, then the task's own fields.
        {with([](TaskInfo& t) {
             t.SetSyncInfo(SyncInfo());
             t.SetName("");
         }),
         p + "Empty server ip and name\n"},
        {with([](TaskInfo& t) {
             t.GetSchedule().SetStartHour(24);
             t.SetName("");
         }),
         p + "Invalid begin hour\n"},
        // These two lines have no newline of their own.
        {with([](TaskInfo& t) { t.SetName(""); }), p + "Empty task name"},
        {with([](TaskInfo& t) { t.SetShareList({}); }), p + "Empty share list"},
        {with([](TaskInfo& t) {
             t.SetShareList({"docs", "photos", "missing"});
         }),
         p + "Share 'photos' is not valid\n"},
    };
    for (const auto& [task, line] : cases) {
        LogCapture log;
        const std::list<std::string> shares = task.GetShareList();
        EXPECT_FALSE(task.Validate()) << line;
        EXPECT_EQ(line, Logged(log));
        EXPECT_EQ(shares, task.GetShareList());
    }
    // An unknown share: the host says why, the task names the share and stops there.
    LogCapture log;
    EXPECT_FALSE(with([](TaskInfo& t) {
                     t.SetShareList({"docs", "nosuch", "photos"});
                 }).Validate());
    const std::string text = Logged(log);
    EXPECT_NE(std::string::npos, text.find("Fail to get share 'nosuch'")) << text;
    EXPECT_NE(std::string::npos, text.find(p + "Share 'nosuch' is not valid\n")) << text;
    EXPECT_EQ(std::string::npos, text.find("photos")) << text;
}

}  // namespace
