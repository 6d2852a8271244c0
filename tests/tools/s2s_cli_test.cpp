// The s2s program's own checks, before any server is contacted: the command lines it takes, the
// strict task file, where a password may come from, the share registry, next-run's answers, and
// the front end of the sync service against a stand-in that answers canned replies.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <atomic>
#include <deque>
#include <mutex>
#include <nlohmann/json.hpp>
#include <thread>

#include "s2s_control.h"
#include "s2s_ipc.h"
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

// The option table of every command, once: command lines that parse (help pages, the version)
// and command lines that must be refused as usage errors before anything else happens.
TEST_F(CliTest, CommandLinesAndTheirExitCodes) {
    struct Case {
        std::vector<std::string> args;
        int status;
        std::string message = "";  // in the error output when given
    };
    const std::vector<Case> cases = {
        {{"--help"}, 0},
        {{"--version"}, 0},
        {{"sync", "--help"}, 0},
        {{"next-run", "-h"}, 0},
        {{"share", "--help"}, 0},
        {{"share", "add", "--help"}, 0},
        {{"share", "list", "--help"}, 0},
        {{"task", "--help"}, 0},
        {{"task", "add", "--help"}, 0},
        {{"task", "status", "--help"}, 0},
        {{"pause", "--help"}, 0},
        {{"help", "sync"}, 0},
        {{"help", "task", "update"}, 0},
        {{}, 2},
        {{"frobnicate"}, 2},
        {{"help", "frobnicate"}, 2, "unknown command 'frobnicate'"},
        {{"share"}, 2},
        {{"task", "frobnicate"}, 2},
        {{"sync", "--no-such-option"}, 2},
        {{"sync", "extra"}, 2},
        {{"sync", "--ssh-port", "70000", "--share", "a"}, 2},
        {{"sync", "--ssh-port", "0x10", "--share", "a"}, 2},
        {{"sync", "--ssh-port"}, 2, "option '--ssh-port' needs a value (PORT)"},
        {{"sync", "--compress=1"}, 2, "option '--compress' takes no value"},
        {{"sync", "--compress", "--compress"}, 2, "option '--compress' given more than once"},
        {{"next-run", "--at=", "--count", "2"}, 2, "option '--at' needs a value"},
        {{"sync", "--task", "a.json", "--task", "b.json"}, 2},
        {{"sync", "--task", "a.json", "--server", "x"}, 2},
        {{"next-run", "--mode", "Weekly"}, 2},
        {{"next-run", "--at", "24:00"}, 2},
        {{"task", "show"}, 2},
        {{"task", "check", "sync"}, 3, "task file 'sync'"},
        {{"task", "remove", "x1"}, 2},
        {{"task", "run", "1", "2"}, 2},
        {{"task", "update", "1"}, 2},
        {{"task", "add", "--name", "t", "--share", "a", "--ssh", "--no-ssh"}, 2},
        {{"task", "status", "--interval", "5"}, 2},
        {{"task", "history", "--count", "0"}, 2},
        {{"pause", "-1"}, 2},
    };
    for (const Case& c : cases) {
        const Result r = S2s(c.args);
        const std::string line = c.args.empty() ? "(none)" : c.args[0] + " ...";
        EXPECT_EQ(r.status, c.status) << line << " " << r.All();
        EXPECT_NE(r.err.find(c.message), std::string::npos) << line << " " << r.err;
        if (c.status == 0 && c.args.size() > 0 && c.args[0] != "--version") {
            EXPECT_NE(r.out.find("Usage: s2s"), std::string::npos) << line << " " << r.out;
        }
    }
    // The main help lists the exit codes by name.
    const Result r = S2s({"--help"});
    EXPECT_NE(r.out.find("130  cancelled"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("20  no-service"), std::string::npos) << r.out;
}

TEST_F(CliTest, PasswordIsNeverTakenFromTheCommandLine) {
    for (const char* arg : {"--password", "--password=secret"}) {
        const Result r = S2s({"sync", arg, "secret", "--share", "docs"});
        EXPECT_EQ(r.status, 2) << r.All();
        EXPECT_NE(r.err.find("never given on the command line"), std::string::npos) << r.err;
    }
    for (const char* command : {"add", "update"}) {
        const Result r = S2s({"task", command, "--password=secret"});
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
        {"{\"week_schd\": \"01111102\"}", "key \"week_schd\" must be seven '0'/'1'"},
        {"{\"max_delete\": \"20%%\"}", "key \"max_delete\": deletion limit"},
        {"{\"max_delete\": \"2147483648\"}", "'2147483648' is out of range (at most 2147483647)"},
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

    // A share may be called like a command.
    EXPECT_EQ(S2s({"share", "add", "list", "--path", host_.SharePath("docs")}).status, 0);
    EXPECT_EQ(S2s({"share", "remove", "list"}).status, 0);
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
    // The evening before the clocks go back: 09:00 by the wall clock; other front ends show 08:00.
    const std::map<std::string, std::string> berlin = {{"TZ", "Europe/Berlin"}};
    const std::vector<std::string> daily9 = {"next-run", "--at", "09:00", "--now",
                                             "2024-10-26 23:00"};
    r = S2s(daily9, berlin);
    EXPECT_EQ(r.out,
              "Sun 2024-10-27 09:00:00 CET (in 11h00m)\n"
              "note: other front ends (--compatible) show Sun 2024-10-27 08:00:00 CET instead of "
              "Sun 2024-10-27 09:00:00 CET\n")
        << r.All();
    std::vector<std::string> args = daily9;
    args.push_back("--compatible");
    EXPECT_EQ(S2s(args, berlin).out, "Sun 2024-10-27 08:00:00 CET (in 10h00m)\n");
    // A time the clocks skip is refused, not moved.
    r = S2s({"next-run", "--at", "09:00", "--now", "2024-03-31 02:30"}, berlin);
    EXPECT_EQ(r.status, 2) << r.All();
    EXPECT_NE(r.err.find("does not exist in the local time zone"), std::string::npos) << r.err;
}

// The sync service's control socket below a host's root, answering each request with the next
// reply queued for its command, or plain success when none is.
class FakeService {
  public:
    explicit FakeService(const std::string& root) : path_(root + "/run/s2s/s2sd.sock") {
        MakeDirs(root + "/run/s2s", 0700);
        if (listener_.prepare(path_) != 0) {
            throw std::runtime_error("cannot listen on " + path_);
        }
        listener_.setTimeout({0, 20000});
        thread_ = std::thread([this] { Serve(); });
    }
    ~FakeService() {
        stop_ = true;
        thread_.join();
    }

    void Answer(const std::string& command, S2S::PObject reply) {
        std::lock_guard<std::mutex> lock(mutex_);
        replies_[command].push_back(std::move(reply));
    }
    void Fail(const std::string& command, unsigned status, const std::string& message) {
        S2S::PObject reply;
        reply["status"] = status;
        reply["message"] = message;
        Answer(command, reply);
    }
    std::vector<S2S::PObject> Requests() {
        std::lock_guard<std::mutex> lock(mutex_);
        return requests_;
    }

  private:
    void Serve() {
        while (!stop_) {
            if (!listener_.isReady()) {
                continue;
            }
            const int fd = listener_.accept();
            S2S::IPCSender peer;
            if (fd < 0 || peer.assign(fd) != 0) {
                continue;
            }
            S2S::PObject request;
            if (peer.recv(request) != 0) {
                continue;
            }
            S2S::PObject reply;
            reply["status"] = 0U;
            {
                std::lock_guard<std::mutex> lock(mutex_);
                requests_.push_back(request);
                std::deque<S2S::PObject>& queue = replies_[request["command"].asString()];
                if (!queue.empty()) {
                    reply = queue.front();
                    queue.pop_front();
                }
            }
            peer.send(reply);
        }
    }

    std::string path_;
    S2S::IPCListener listener_;
    std::mutex mutex_;
    std::map<std::string, std::deque<S2S::PObject>> replies_;
    std::vector<S2S::PObject> requests_;
    std::atomic<bool> stop_{false};
    std::thread thread_;
};

S2S::PObject Tasks(const std::vector<S2S::PObject>& entries, const char* key = "tasks") {
    S2S::PObject reply;
    reply["status"] = 0U;
    reply[key] = S2S::PObject::Array(entries.begin(), entries.end());
    return reply;
}

S2S::PObject StatusEntry(unsigned id, const std::string& state, unsigned long long done) {
    S2S::PObject entry;
    entry["task_id"] = id;
    entry["name"] = "nightly";
    entry["state"] = state;
    entry["share"] = "docs";
    entry["bytes_done"] = done;
    entry["bytes_total"] = 1000ULL;
    return entry;
}

TEST_F(CliTest, WithoutTheServiceItsOwnExitCode) {
    // No socket at all, then a socket file nobody listens on (the service died).
    Result r = S2s({"task", "list"});
    EXPECT_EQ(r.status, 20) << r.All();
    EXPECT_NE(r.err.find("s2sd is not running"), std::string::npos) << r.err;
    MakeDirs(host_.Root() + "/run/s2s", 0700);
    const int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    const std::string path = host_.Root() + "/run/s2s/s2sd.sock";
    std::strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
    ASSERT_EQ(bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)), 0);
    close(fd);
    r = S2s({"pause"});
    EXPECT_EQ(r.status, 20) << r.All();
    EXPECT_NE(r.err.find("refuses connections"), std::string::npos) << r.err;
}

// Each status code of the control protocol has its exit code, and the service's message is shown.
TEST_F(CliTest, ServiceStatusCodesMapToExitCodes) {
    FakeService service(host_.Root());
    const std::vector<std::pair<unsigned, int>> cases = {
        {0, 0}, {1, 24}, {2, 3}, {3, 21}, {4, 22}, {5, 23}, {6, 24}, {7, 24}, {99, 24}};
    for (const auto& c : cases) {
        service.Fail("cancel", c.first, "told " + std::to_string(c.first));
        const Result r = S2s({"task", "cancel", "7"});
        EXPECT_EQ(r.status, c.second) << c.first << " " << r.All();
        if (c.first != 0) {
            EXPECT_NE(r.err.find("told " + std::to_string(c.first)), std::string::npos) << r.err;
        }
    }
    EXPECT_EQ(service.Requests().back()["task_id"].asUInt64(), 7U);
}

TEST_F(CliTest, TaskAddSendsThePasswordBesideTheTask) {
    FakeService service(host_.Root());
    S2S::PObject added;
    added["status"] = 0U;
    added["task_id"] = 7U;
    service.Answer("add", added);
    const std::string password = host_.Root() + "/pw";
    WriteFile(password, "secret\n");
    chmod(password.c_str(), 0600);
    Result r =
        S2s({"task", "add", "--task",
             TaskFile("{\"name\": \"t\", \"schedule_mode\": 2, \"pswd\": \"old\"}", 0600),
             "--server-ip", "10.0.0.1", "--user", "u", "--share", "docs", "--compress",
             "--max-delete", "20%", "--allow-empty-source", "--password-file", password, "--json"});
    EXPECT_EQ(r.status, 0) << r.All();
    EXPECT_EQ(nlohmann::json::parse(r.out)["task_id"], 7) << r.out;
    const S2S::PObject request = service.Requests().back();
    const S2S::PObject& task = request["task"];
    EXPECT_EQ(request["command"].asString(), "add");
    EXPECT_EQ(request["password"].asString(), "secret");
    EXPECT_FALSE(task.hasMember("pswd"));
    EXPECT_EQ(task["name"].asString(), "t");
    EXPECT_EQ(task["schedule_mode"].asInt32(), 2);
    EXPECT_EQ(task["server_ip"].asString(), "10.0.0.1");
    EXPECT_TRUE(task["compress"].asBool());
    EXPECT_TRUE(task["allow_empty_source"].asBool());
    EXPECT_EQ(task["max_delete"].asString(), "20%");
    EXPECT_EQ(task["share_list"][0U].asString(), "docs");
    // The password sources are those of s2s sync, with the same exit code.
    chmod(password.c_str(), 0644);
    r = S2s({"task", "add", "--name", "t", "--share", "docs", "--password-file", password});
    EXPECT_EQ(r.status, 4) << r.All();
    r = S2s({"task", "add", "--share", "docs"});
    EXPECT_EQ(r.status, 3) << r.All();
}

// update changes only what it is given: the rest comes from the task the service keeps.
TEST_F(CliTest, TaskUpdateOverlaysTheServicesTask) {
    FakeService service(host_.Root());
    S2S::PObject shown;
    shown["status"] = 0U;
    shown["task"]["task_id"] = 3U;
    shown["task"]["name"] = "nightly";
    shown["task"]["share_list"] = S2S::PObject::Array{S2S::PObject("docs")};
    shown["task"]["user"] = "u";
    shown["task"]["state"] = "idle";
    shown["task"]["next_run"] = 1795000000ULL;
    service.Answer("show", shown);
    service.Fail("update", 0, "");
    const Result r = S2s({"task", "update", "3", "--max-bandwidth", "100"});
    EXPECT_EQ(r.status, 0) << r.All();
    const S2S::PObject request = service.Requests().back();
    const S2S::PObject& task = request["task"];
    EXPECT_EQ(request["command"].asString(), "update");
    EXPECT_FALSE(request.hasMember("password"));
    EXPECT_EQ(task["task_id"].asUInt64(), 3U);
    EXPECT_EQ(task["name"].asString(), "nightly");
    EXPECT_EQ(task["user"].asString(), "u");
    EXPECT_EQ(task["max_bandwidth"].asUInt32(), 100U);
    EXPECT_FALSE(task.hasMember("state") || task.hasMember("next_run") || task.hasMember("pswd"));
}

TEST_F(CliTest, ServiceListingsForPeopleAndScripts) {
    FakeService service(host_.Root());
    S2S::PObject task;
    task["task_id"] = 1U;
    task["name"] = "nightly";
    task["share_list"] = S2S::PObject::Array{S2S::PObject("docs"), S2S::PObject("vault")};
    task["compress"] = true;
    task["state"] = "idle";
    task["next_run"] = 1795000000ULL;
    service.Answer("list", Tasks({task}));
    service.Answer("list", Tasks({task}));
    Result r = S2s({"task", "list"}, {{"TZ", "UTC"}});
    EXPECT_EQ(r.status, 0) << r.All();
    EXPECT_NE(r.out.find("nightly"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("docs, vault"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("Wed 2026-11-18 11:06:40"), std::string::npos) << r.out;
    r = S2s({"task", "list", "--json"});
    const nlohmann::json doc = nlohmann::json::parse(r.out);
    EXPECT_EQ(doc[0]["compress"], true) << r.out;
    EXPECT_EQ(doc[0]["next_run"], 1795000000ULL) << r.out;

    // --watch refreshes until nothing runs any more.
    service.Answer("status", Tasks({StatusEntry(1, "running", 450)}));
    service.Answer("status", Tasks({StatusEntry(1, "idle", 0)}));
    r = S2s({"task", "status", "--watch"});
    EXPECT_EQ(r.status, 0) << r.All();
    EXPECT_NE(r.out.find("45% 450 B of 1000 B"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("idle"), std::string::npos) << r.out;
    EXPECT_EQ(service.Requests().size(), 4U);

    S2S::PObject run;
    run["task_id"] = 1U;
    run["start"] = 1795000000ULL;
    run["end"] = 1795000065ULL;
    run["result"] = 10U;
    S2S::PObject share;
    share["name"] = "docs";
    share["files"] = 12U;
    share["bytes"] = 2048U;
    share["guard"] = "max-delete";
    share["would_delete"] = 40U;
    run["shares"] = S2S::PObject::Array{share};
    service.Answer("history", Tasks({run}, "runs"));
    r = S2s({"task", "history", "1", "--count", "5"});
    EXPECT_EQ(r.status, 0) << r.All();
    EXPECT_NE(r.out.find("1m05s"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("max-delete (10)"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("12 files"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("refused: max-delete, would delete 40"), std::string::npos) << r.out;
    EXPECT_EQ(service.Requests().back()["count"].asUInt64(), 5U);
}

}  // namespace
