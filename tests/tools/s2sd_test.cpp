// s2sd as a program: its control socket under hostile clients, one instance per root, the s2s
// front end managing tasks through it (add with a private password, update, show, list, errors),
// a real-time task on a real inotify watch against a receiver, and SIGTERM (and kill -9) during a
// run followed by a restart.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <nlohmann/json.hpp>

#include "s2s_control.h"
#include "s2s_control_client.h"
#include "s2s_ipc.h"
#include "s2s_task_run.h"
#include "support/server_pair.h"
#include "support/tree_manifest.h"

namespace {

namespace fs = std::filesystem;

namespace Control = S2S::Control;
using nlohmann::json;
using S2S::PObject;
using s2s_test::Host;
using s2s_test::ProgramResult;
using s2s_test::WaitFor;
using s2s_test::WriteFile;

// s2sd running under a host's root.
class Daemon {
  public:
    explicit Daemon(const Host& host) : host_(host), env_("S2S_ROOT", host.Root().c_str()) {
        Start();
    }
    void Start() {
        const std::string socket = host_.Root() + Control::kSocketPath;
        unlink(socket.c_str());
        // Temporary files under the host's root: a killed daemon's leftovers go with the test.
        s2s_test::EnvMap env = host_.Env();
        env["TMPDIR"] = host_.Root() + "/tmp";
        mkdir(env["TMPDIR"].c_str(), 0700);
        program_.reset(
            new s2s_test::Program({s2s_test::ToolPath("s2sd"), "--delay", "1", "--verbose"}, env));
        EXPECT_TRUE(WaitFor([&] { return access(socket.c_str(), F_OK) == 0; }));
    }
    ~Daemon() {
        if (program_) {
            Stop(SIGTERM);  // a clean end, as a service manager would
        }
    }
    int Stop(int signo) {
        kill(program_->Pid(), signo);
        const ProgramResult r = program_->Wait();
        program_.reset();
        log_ += r.err;
        return r.status;
    }
    pid_t Pid() const { return program_->Pid(); }
    const std::string& Log() const { return log_; }
    PObject Call(const PObject& request) {
        PObject reply;
        std::string error;
        EXPECT_EQ(Control::Request(request, reply, error), 0) << error;
        return reply;
    }
    // s2s with this host's root; the parsed JSON when it printed some.
    ProgramResult S2s(const std::vector<std::string>& args, json* doc = nullptr) {
        const ProgramResult r = host_.Run("s2s", args);
        if (doc != nullptr) {
            *doc = json::parse(r.out, nullptr, false);
        }
        return r;
    }

  private:
    const Host& host_;
    s2s_test::ScopedEnv env_;
    std::unique_ptr<s2s_test::Program> program_;
    std::string log_;
};

PObject Command(const char* command, const char* key = nullptr, const PObject& value = PObject()) {
    PObject request;
    request[Control::kKeyCommand] = command;
    if (key != nullptr) {
        request[key] = value;
    }
    return request;
}

// `s2s task add` of a task for `share` from `file` (JSON) with the password `password`.
std::vector<std::string> AddArgs(const Host& host, const std::string& share,
                                 const std::string& task, const std::string& password) {
    static int n = 0;
    const std::string file = host.Root() + "/task" + std::to_string(++n);
    WriteFile(file + ".json", task);
    WriteFile(file + ".pw", password + "\n");
    chmod((file + ".pw").c_str(), 0600);
    return {"task",    "add",     "--task", file + ".json",    "--server-ip", "127.0.0.1", "--user",
            "s2suser", "--share", share,    "--password-file", file + ".pw",  "--json"};
}

TEST(S2sd, ControlSocketServesHostileClientsAndTheFrontEnd) {
    Host host("s2sd", "SN-S2SD");
    host.AddShare("docs");
    Daemon daemon(host);
    const std::string socket = host.Root() + Control::kSocketPath;
    struct stat st;
    ASSERT_EQ(stat(socket.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    // A client that connects and says nothing holds no one up.
    S2S::IPCSender silent;
    ASSERT_EQ(silent.connect(socket), 0);
    PObject nested = Command(Control::kList);
    PObject* inner = &nested["x"];
    for (int i = 0; i < 40; ++i) {
        inner = &(*inner)["y"];
        *inner = PObject();
    }
    PObject numberCommand;
    numberCommand[Control::kKeyCommand] = 5ULL;
    const struct {
        PObject request;
        unsigned long long status;
        const char* words;
    } cases[] = {
        {PObject("list"), Control::kBadRequest, "not a map"},
        {numberCommand, Control::kBadRequest, "command"},
        {Command("frobnicate"), Control::kBadRequest, "unknown command 'frobnicate'"},
        {Command(Control::kShow, Control::kKeyTaskId, PObject("1")), Control::kBadRequest,
         "'task_id' must be an integer"},
        {Command(Control::kAdd, Control::kKeyTask, PObject("a task")), Control::kBadRequest,
         "'task' must be a task map"},
        {Command(Control::kShow), Control::kBadRequest, "'task_id' is missing"},
        {nested, Control::kTooLarge, "nests deeper"},
    };
    for (const auto& c : cases) {
        const PObject reply = daemon.Call(c.request);
        EXPECT_EQ(reply[Control::kKeyStatus].asUInt64(), c.status) << c.request.toString();
        EXPECT_NE(reply[Control::kKeyMessage].asString().find(c.words), std::string::npos)
            << reply[Control::kKeyMessage].asString();
    }
    {
        PObject big = Command(Control::kList);  // 100 MB in one request
        big["junk"] = PObject::Array(1600, PObject(std::string(65000, 'x')));
        S2S::IPCSender sender;
        PObject reply;
        ASSERT_EQ(sender.connect(socket), 0);
        ASSERT_EQ(sender.send(big, true, reply), 0);
        EXPECT_EQ(reply[Control::kKeyStatus].asUInt64(), Control::kTooLarge);
    }
    {
        std::vector<std::unique_ptr<S2S::IPCSender>> clients;  // 200 at once, each answered
        for (int i = 0; i < 200; ++i) {
            clients.emplace_back(new S2S::IPCSender);
            ASSERT_EQ(clients.back()->connect(socket), 0) << i;
            ASSERT_EQ(clients.back()->send(Command(Control::kList)), 0);
        }
        for (auto& client : clients) {
            PObject reply;
            ASSERT_EQ(client->recv(reply), 0);
            EXPECT_EQ(reply[Control::kKeyStatus].asUInt64(), Control::kOk);
        }
    }
    PObject told;  // the silent client is told in the end
    ASSERT_EQ(silent.recv(told), 0);
    EXPECT_NE(told[Control::kKeyMessage].asString().find("no complete request"), std::string::npos);
    // The front end: the password travels beside the task into a root-only file and never
    // comes back; an update changes only what it is given.
    json doc;
    const std::string task = R"({"name": "nightly", "schedule_mode": 0, "compress": true})";
    ProgramResult r = daemon.S2s(AddArgs(host, "docs", task, "secret-pw"), &doc);
    ASSERT_EQ(r.status, 0) << r.All();
    const std::string id = std::to_string(doc["task_id"].get<unsigned>());
    ASSERT_EQ(stat((host.Root() + Control::kPasswordDir + "/" + id).c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    EXPECT_EQ(daemon
                  .S2s({"task", "update", id, "--max-bandwidth", "100", "--allow-empty-source",
                        "--max-delete", "20%"})
                  .status,
              0);
    r = daemon.S2s({"task", "show", id, "--json"}, &doc);
    EXPECT_EQ(doc["name"], "nightly") << r.out;
    EXPECT_EQ(doc["compress"], true) << r.out;
    EXPECT_EQ(doc["max_bandwidth"], 100) << r.out;
    EXPECT_EQ(doc["allow_empty_source"], true) << r.out;
    EXPECT_EQ(doc["max_delete"], "20%") << r.out;
    EXPECT_EQ(doc["state"], "idle") << r.out;
    EXPECT_EQ(r.out.find("secret-pw"), std::string::npos);
    r = daemon.S2s({"task", "list"});
    EXPECT_NE(r.out.find("nightly"), std::string::npos) << r.All();
    const struct {
        std::vector<std::string> args;
        int status;
        const char* words;
    } errors[] = {
        {AddArgs(host, "nosuchshare", task, "pw"), 3, "share 'nosuchshare' is not valid"},
        {AddArgs(host, "docs", R"({"name": "../nightly"})", "pw"), 3, "not one a receiver takes"},
        {{"task", "show", "99"}, 21, ""},
        {{"task", "cancel", id}, 23, ""},
        {AddArgs(host, "docs", task, "pw"), 24, ""},
    };
    for (const auto& e : errors) {
        if (e.status == 24) {
            fs::remove_all(host.Root() + Control::kPasswordDir);  // a file in the way
            WriteFile(host.Root() + Control::kPasswordDir, "");
        }
        r = daemon.S2s(e.args);
        EXPECT_EQ(r.status, e.status) << r.All();
        EXPECT_NE(r.err.find(e.words), std::string::npos) << r.err;
    }
    // A second daemon on the same root (foreground or detaching) is refused; the first serves on.
    for (const char* mode : {"--verbose", "--daemon"}) {
        r = host.Run("s2sd", {mode});
        EXPECT_EQ(r.status, 1) << mode;
        EXPECT_NE(r.err.find("s2sd is already running (pid " + std::to_string(daemon.Pid()) + ")"),
                  std::string::npos)
            << r.err;
    }
    EXPECT_EQ(daemon.Call(Command(Control::kList))[Control::kKeyStatus].asUInt64(), Control::kOk);
    EXPECT_EQ(daemon.Stop(SIGTERM), 0);
    EXPECT_EQ(daemon.Log().find("secret-pw"), std::string::npos);
}

// A sending host with s2sd and a receiver, in a network of their own.
class WithReceiver : public ::testing::Test {
  protected:
    void SetUp() override {
        s2s_test::PairOptions options;
        options.standardPort = true;
        const std::string why = s2s_test::ServerPair::Unavailable(options);
        if (!why.empty()) {
            GTEST_SKIP() << why;
        }
        pair_.reset(new s2s_test::ServerPair(options));
        source_ = pair_->Sender().AddShare("docs");
        copy_ = pair_->Receiver().AddShare("docs");
        ASSERT_EQ(pair_->Start(), "");
        daemon_.reset(new Daemon(pair_->Sender()));
    }
    std::string Add(const std::string& task) {
        json doc;
        const ProgramResult r =
            daemon_->S2s(AddArgs(pair_->Sender(), "docs", task, "pw-9Xq2r"), &doc);
        EXPECT_EQ(r.status, 0) << r.All();
        return r.status == 0 ? std::to_string(doc["task_id"].get<unsigned>()) : "0";
    }
    // The task's runs, newest first.
    json Runs(const std::string& id) {
        json doc;
        daemon_->S2s({"task", "history", id, "--json"}, &doc);
        return doc.is_array() ? doc : json::array();
    }
    // Waits until the task has `count` runs and is no longer running.
    bool WaitForRuns(const std::string& id, size_t count) {
        return WaitFor(
            [&] {
                json status;
                daemon_->S2s({"task", "status", id, "--json"}, &status);
                return Runs(id).size() >= count &&
                       status.dump().find("\"running\"") == std::string::npos;
            },
            std::chrono::seconds(60));
    }
    bool Arrived(const std::string& path, const std::string& content) {
        return WaitFor([&] { return s2s_test::ReadFile(copy_ + path) == content; },
                       std::chrono::seconds(60));
    }
    std::unique_ptr<s2s_test::ServerPair> pair_;
    std::unique_ptr<Daemon> daemon_;
    std::string source_;
    std::string copy_;
};

// A real-time task syncs whole at once, then sends what changed: a file in a directory that
// appeared (watched too), a deletion, and the folder gone and back (a volume unmounted and
// mounted again).
TEST_F(WithReceiver, RealTimeTaskSendsWhatChanged) {
    for (int i = 0; i < 50; ++i) {
        WriteFile(source_ + "/file" + std::to_string(i), std::string(1000, 'a' + i % 26));
    }
    const std::string id = Add(R"({"name": "live", "schedule_mode": 1})");
    ASSERT_TRUE(WaitForRuns(id, 1)) << daemon_->Log();
    EXPECT_EQ(Runs(id)[0]["result"], 0) << Runs(id).dump();
    fs::create_directories(source_ + "/new");
    ASSERT_TRUE(WaitFor([&] { return access((copy_ + "/new").c_str(), F_OK) == 0; },
                        std::chrono::seconds(60)));
    WriteFile(source_ + "/new/later", "written later");
    ASSERT_TRUE(Arrived("/new/later", "written later")) << daemon_->Log();
    // That run sent the one file, not the share's 50 KB.
    const std::string log = s2s_test::ReadFile(pair_->Sender().Root() + "/var/log/s2s_rsync.log");
    EXPECT_NE(log.find("total size 13\n"), std::string::npos) << log;
    ASSERT_EQ(unlink((source_ + "/file7").c_str()), 0);
    ASSERT_TRUE(WaitFor([&] { return access((copy_ + "/file7").c_str(), F_OK) != 0; },
                        std::chrono::seconds(60)));
    const size_t runs = Runs(id).size();
    s2s_test::RemoveTree(source_);
    ASSERT_TRUE(WaitForRuns(id, runs + 1)) << daemon_->Log();
    fs::create_directories(source_);
    WriteFile(source_ + "/back", "after the return");
    EXPECT_TRUE(Arrived("/back", "after the return")) << daemon_->Log();
    ASSERT_TRUE(WaitForRuns(id, runs + 2)) << daemon_->Log();
    const std::string history = daemon_->S2s({"task", "history", id, "--count", "1"}).out;
    EXPECT_NE(history.find("  ok (0)\n     docs  result 0  1 files  16 B  "), std::string::npos)
        << history;
}

// SIGTERM cancels the run (no rsync left, the share not complete); kill -9 leaves a run that
// the restarted daemon records as interrupted; the task and its history survive both, and a
// later run refused by the source check is recorded with its reason.
TEST_F(WithReceiver, StoppedOrKilledDuringARunTheTaskAndHistorySurvive) {
    WriteFile(source_ + "/big",
              s2s_test::RunProgram({"/usr/bin/head", "-c", "8M", "/dev/urandom"}).out);
    const std::string id = Add(R"({"name": "slow", "schedule_mode": 0, "max_bandwidth": 1024})");
    ASSERT_EQ(daemon_->S2s({"task", "run", id}).status, 0);
    ASSERT_TRUE(WaitFor(  // rsync's temporary file sorts first
        [&] {
            const auto tree = s2s_test::TreeManifest(copy_);
            return !tree.empty() && tree.begin()->first[1] == '.';
        },
        std::chrono::seconds(60)))
        << "rsync's temporary file never came: " << daemon_->Log();
    const ProgramResult busy = daemon_->S2s({"task", "remove", id});
    EXPECT_EQ(busy.status, 22) << busy.All();
    EXPECT_EQ(daemon_->Stop(SIGTERM), 0);
    EXPECT_EQ(s2s_test::RunProgram({"/usr/bin/pgrep", "-f", source_}).out, "");
    EXPECT_EQ(pair_->Receiver().Run("s2s-receiver", {"status"}).out.find("last sync completed"),
              std::string::npos);
    daemon_->Start();
    ASSERT_EQ(daemon_->S2s({"task", "run", id}).status, 0);
    ASSERT_TRUE(WaitFor([&] { return Runs(id).size() == 2; })) << daemon_->Log();
    EXPECT_NE(daemon_->S2s({"task", "status", id}).out.find("running"), std::string::npos);
    EXPECT_EQ(daemon_->Stop(SIGKILL), 128 + SIGKILL);
    // SIGKILL leaves the daemon no chance to stop its rsync; the administrator's kill does.
    s2s_test::RunProgram({"/usr/bin/pkill", "-KILL", "-f", source_});
    daemon_->Start();
    const json runs = Runs(id);
    ASSERT_EQ(runs.size(), 2u) << runs.dump();
    EXPECT_EQ(runs[0]["result"], 99) << "interrupted";
    EXPECT_NE(runs[0]["end"], 0);
    EXPECT_EQ(runs[1]["result"], static_cast<int>(S2S::RunFailure::kCancelled));
    json shown;
    daemon_->S2s({"task", "show", id, "--json"}, &shown);
    EXPECT_EQ(shown["name"], "slow");
    EXPECT_EQ(daemon_->S2s({"task", "status", "--watch"}).status, 0) << "nothing runs";
    // The folder emptied over the receiver's copy: the run is refused, and the history says why.
    fs::remove(source_ + "/big");
    WriteFile(copy_ + "/kept", "the receiver's copy");
    ASSERT_EQ(daemon_->S2s({"task", "run", id}).status, 0);
    ASSERT_TRUE(WaitForRuns(id, 3)) << daemon_->Log();
    const std::string history = daemon_->S2s({"task", "history", id, "--count", "1"}).out;
    EXPECT_NE(history.find("refused: empty-source, would delete 1"), std::string::npos) << history;
}

}  // namespace
