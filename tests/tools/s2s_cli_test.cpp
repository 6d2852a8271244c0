// The s2s program's own checks, before any server is contacted: help on every command, the
// strict task file, where a password may come from, the share registry, and next-run's answers.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include "tools/s2s_scenario.h"

namespace {

using namespace s2s_scenario;
using s2s_test::WriteFile;

class CliTest : public ::testing::Test {
  protected:
    CliTest() : host_("cli", "SN-CLI") {}

    Result S2s(const std::vector<std::string>& args,
               const std::map<std::string, std::string>& env = {}) const {
        return host_.Run("s2s", args, "", env);
    }
    std::string TaskFile(const std::string& json, mode_t mode = 0644) const {
        const std::string path = host_.Root() + "/task" + std::to_string(++files_) + ".json";
        WriteFile(path, json);
        chmod(path.c_str(), mode);
        return path;
    }

    Host host_;
    mutable int files_ = 0;
};

TEST_F(CliTest, EveryCommandAnswersHelp) {
    for (const std::vector<std::string>& args :
         std::vector<std::vector<std::string>>{{"--help"},
                                               {"sync", "--help"},
                                               {"next-run", "--help"},
                                               {"share", "--help"},
                                               {"share", "add", "--help"},
                                               {"share", "remove", "--help"},
                                               {"share", "list", "--help"},
                                               {"task", "--help"},
                                               {"help", "sync"}}) {
        const Result r = S2s(args);
        EXPECT_EQ(r.status, 0) << args[0] << " " << r.All();
        EXPECT_NE(r.out.find("Usage: s2s"), std::string::npos) << args[0] << " " << r.out;
    }
    // The main help lists the exit codes by name.
    const Result r = S2s({"--help"});
    EXPECT_NE(r.out.find("130  cancelled"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("7  conflict"), std::string::npos) << r.out;
}

TEST_F(CliTest, UsageErrorsExitWithTwo) {
    EXPECT_EQ(S2s({}).status, 2);
    EXPECT_EQ(S2s({"frobnicate"}).status, 2);
    EXPECT_EQ(S2s({"sync", "--no-such-option"}).status, 2);
    EXPECT_EQ(S2s({"sync", "--ssh-port", "70000", "--share", "a"}).status, 2);
    EXPECT_EQ(S2s({"sync", "--ssh-port"}).status, 2);
    EXPECT_EQ(S2s({"sync", "--task", "a.json", "--task", "b.json"}).status, 2);
    EXPECT_EQ(S2s({"sync", "--task", "a.json", "--server", "x"}).status, 2);
    EXPECT_EQ(S2s({"next-run", "--mode", "Weekly"}).status, 2);
    EXPECT_EQ(S2s({"next-run", "--at", "24:00"}).status, 2);
}

TEST_F(CliTest, PasswordIsNeverTakenFromTheCommandLine) {
    for (const char* arg : {"--password", "--password=secret"}) {
        const Result r = S2s({"sync", arg, "secret", "--share", "docs"});
        EXPECT_EQ(r.status, 2) << r.All();
        EXPECT_NE(r.err.find("never given on the command line"), std::string::npos) << r.err;
    }
}

TEST_F(CliTest, PasswordFileMustBePrivate) {
    const std::string path = host_.Root() + "/pw";
    WriteFile(path, "secret\n");
    chmod(path.c_str(), 0644);
    Result r = S2s({"sync", "--server-ip", "127.0.0.1", "--user", "u", "--share", "docs",
                    "--password-file", path});
    EXPECT_EQ(r.status, 4) << r.All();
    EXPECT_NE(r.err.find("can be read by other users"), std::string::npos) << r.err;
    r = S2s({"sync", "--server-ip", "127.0.0.1", "--user", "u", "--share", "docs",
             "--password-file", host_.Root() + "/missing"});
    EXPECT_EQ(r.status, 4) << r.All();
    r = S2s({"sync", "--server-ip", "127.0.0.1", "--user", "u", "--share", "docs",
             "--password-file", host_.Root()});
    EXPECT_EQ(r.status, 4) << r.All();
    EXPECT_NE(r.err.find("is not a regular file"), std::string::npos) << r.err;
    // One byte longer than rsync can authenticate with the user "u".
    WriteFile(path, std::string(1022, 'p') + "\n");
    chmod(path.c_str(), 0600);
    r = S2s({"sync", "--server-ip", "127.0.0.1", "--user", "u", "--share", "docs",
             "--password-file", path});
    EXPECT_EQ(r.status, 4) << r.All();
    EXPECT_NE(r.err.find("the password is too long"), std::string::npos) << r.err;
}

TEST_F(CliTest, TaskFilesAreCheckedStrictly) {
    struct Case {
        std::string json;
        std::string message;
    };
    const std::vector<Case> cases = {
        {"{\"name\": \"t\", \"shares\": [\"a\"]}", "unknown key \"shares\""},
        {"{\"name\": \"t\", \"ssh_port\": \"22\"}", "key \"ssh_port\" must be a whole number"},
        {"{\"ssh_port\": 4294967296}", "key \"ssh_port\" must be a whole number"},
        {"{\"schedule_mode\": 2.5}", "key \"schedule_mode\" must be a whole number"},
        {"{\"compress\": 2}", "key \"compress\" must be true, false, 1 or 0"},
        {"{\"share_list\": [\"a\", 1]}", "every entry must be a string"},
        {"{\"name\": \"a\", \"name\": \"b\"}", "key \"name\" appears more than once"},
        {"[1, 2]", "one JSON object"},
        {"{\"name\": \"t\",}", "not valid JSON"},
        {"{\"name\": \"a\\u0000b\"}", "NUL character"},
    };
    for (const Case& c : cases) {
        const Result r = S2s({"task", "check", TaskFile(c.json)});
        EXPECT_EQ(r.status, 3) << c.json << " " << r.All();
        EXPECT_NE(r.err.find(c.message), std::string::npos) << c.json << " " << r.err;
    }
}

TEST_F(CliTest, TaskFileWithAPasswordMustBePrivate) {
    const std::string json = "{\"name\": \"t\", \"pswd\": \"secret\", \"share_list\": [\"docs\"]}";
    Result r = S2s({"task", "show", TaskFile(json, 0644)});
    EXPECT_EQ(r.status, 3) << r.All();
    EXPECT_NE(r.err.find("other users can read it"), std::string::npos) << r.err;
    // Shown, a private task file never prints its password.
    r = S2s({"task", "show", TaskFile(json, 0600)});
    EXPECT_EQ(r.status, 0) << r.All();
    EXPECT_EQ(r.All().find("secret"), std::string::npos) << r.All();
}

TEST_F(CliTest, TaskCheckValidatesLikeASyncWould) {
    host_.AddShare("docs");
    const std::string base = "\"share_list\": [\"docs\"], \"server_ip\": \"10.0.0.1\"";
    Result r = S2s({"task", "check", TaskFile("{\"name\": \"t\", " + base + ", \"user\": \"u\"}")});
    EXPECT_EQ(r.status, 0) << r.All();
    // The first broken rule is shown as the sync model's note.
    r = S2s({"task", "check", TaskFile("{\"name\": \"t\", " + base + "}")});
    EXPECT_EQ(r.status, 3) << r.All();
    EXPECT_NE(r.err.find("Empty user name ''"), std::string::npos) << r.err;
    r = S2s({"task", "check",
             TaskFile("{\"name\": \"t\", " + base +
                      ", \"user\": \"u\", \"schedule_begin_hour\": 24}")});
    EXPECT_EQ(r.status, 3) << r.All();
    EXPECT_NE(r.err.find("Invalid begin hour"), std::string::npos) << r.err;
    r = S2s({"task", "check",
             TaskFile("{\"name\": \"t\", \"share_list\": [\"nope\"], \"server_ip\": \"10.0.0.1\", "
                      "\"user\": \"u\"}")});
    EXPECT_EQ(r.status, 3) << r.All();
    EXPECT_NE(r.err.find("Share 'nope' is not valid"), std::string::npos) << r.err;
    // sync checks the same before it contacts anything.
    r = S2s({"sync", "--server-ip", "10.0.0.1", "--user", "u", "--share", "nope"});
    EXPECT_EQ(r.status, 3) << r.All();
}

TEST_F(CliTest, ShareRegistryRoundTrip) {
    MakeDirs(host_.SharePath("docs"));
    MakeDirs(host_.SharePath("vault"));
    EXPECT_EQ(S2s({"share", "list"}).out, "no shares registered\n");
    Result r = S2s({"share", "add", "docs", "--path", host_.SharePath("docs")});
    EXPECT_EQ(r.status, 0) << r.All();
    r = S2s({"share", "add", "vault", "--path", host_.SharePath("vault"), "--encrypted",
             "--key-len", "32"});
    EXPECT_EQ(r.status, 0) << r.All();
    EXPECT_TRUE(IsPathThere(host_.Volume() + "/@vault@"));
    // A second add of the same name is refused unless asked to replace.
    EXPECT_EQ(S2s({"share", "add", "docs", "--path", host_.SharePath("docs")}).status, 11);
    EXPECT_EQ(S2s({"share", "add", "docs", "--path", host_.SharePath("docs"), "--acl", "--replace"})
                  .status,
              0);
    r = S2s({"share", "list"});
    EXPECT_NE(r.out.find("docs"), std::string::npos);
    EXPECT_NE(r.out.find("[acl]"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("[encrypted]"), std::string::npos) << r.out;
    r = S2s({"share", "list", "--json"});
    EXPECT_NE(r.out.find("\"encrypted\": true"), std::string::npos) << r.out;

    EXPECT_EQ(S2s({"share", "remove", "docs"}).status, 0);
    EXPECT_EQ(S2s({"share", "remove", "docs"}).status, 11);
    EXPECT_TRUE(IsPathThere(host_.SharePath("docs")));  // the files stay
    // Names the registry cannot hold, and folders that do not exist, are refused up front.
    EXPECT_EQ(S2s({"share", "add", "a/b", "--path", host_.SharePath("docs")}).status, 2);
    EXPECT_EQ(S2s({"share", "add", "x", "--path", host_.Root() + "/missing"}).status, 2);
    EXPECT_EQ(S2s({"share", "add", "x", "--path", "relative"}).status, 2);
}

TEST_F(CliTest, NextRunFollowsTheScheduleInLocalTime) {
    const std::map<std::string, std::string> utc = {{"TZ", "UTC"}};
    // Saturday 2026-11-21 10:00 UTC; weekdays at 09:30 and then every 4 hours, twice more.
    Result r = S2s({"next-run", "--days", "mon,tue,wed,thu,fri", "--at", "09:30", "--every",
                    "04:00", "--repeat", "2", "--now", "2026-11-21 10:00", "--count", "4"},
                   utc);
    EXPECT_EQ(r.status, 0) << r.All();
    EXPECT_EQ(r.out,
              "Mon 2026-11-23 09:30:00 UTC (in 1d23h)\n"
              "Mon 2026-11-23 13:30:00 UTC (in 2d03h)\n"
              "Mon 2026-11-23 17:30:00 UTC (in 2d07h)\n"
              "Tue 2026-11-24 09:30:00 UTC (in 2d23h)\n");
    // Local time is the process's time zone.
    r = S2s({"next-run", "--mode", "once", "--begin", "2026-12-24", "--at", "18:00", "--now",
             "@1795000000"},
            {{"TZ", "Asia/Kolkata"}});
    EXPECT_NE(r.out.find("Thu 2026-12-24 18:00:00 IST"), std::string::npos) << r.All();
    r = S2s({"next-run", "--mode", "once", "--begin", "2020-01-01"}, utc);
    EXPECT_NE(r.out.find("no further run"), std::string::npos) << r.out;
    r = S2s({"next-run", "--mode", "manual", "--json"}, utc);
    EXPECT_NE(r.out.find("\"state\": \"manual\""), std::string::npos) << r.out;
    // An impossible schedule is an invalid task, with the reason.
    r = S2s({"next-run", "--at", "23:00", "--every", "00:30", "--repeat", "2"}, utc);
    EXPECT_EQ(r.status, 3) << r.All();
    EXPECT_NE(r.err.find("Invalid repeat in day"), std::string::npos) << r.err;
    r = S2s({"next-run", "--task",
             TaskFile("{\"name\": \"t\", \"schedule_mode\": 3, \"schedule_begin_day\": 31, "
                      "\"schedule_begin_hour\": 2}"),
             "--now", "2026-11-21 10:00"},
            utc);
    EXPECT_EQ(r.out, "task \"t\": Tue 2026-12-01 02:00:00 UTC (in 9d16h)\n") << r.All();
}

}  // namespace
