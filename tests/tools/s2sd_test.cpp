// s2sd as a program: the control socket under hostile clients and a second instance refused, a
// real-time task on a real inotify watch (kept when the share's folder goes away and comes back),
// and a kill -9 during a run followed by a restart.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <sstream>
#include <thread>

#include "s2s_control.h"
#include "s2s_control_client.h"
#include "s2s_ipc.h"
#include "s2s_task_run.h"
#include "tools/s2s_scenario.h"

namespace {

using namespace s2s_scenario;
namespace Control = S2S::Control;
using S2S::PObject;
using s2s_test::WaitFor;
using s2s_test::WriteFile;

const char kUser[] = "backup";
const char kPassword[] = "correct horse battery";

// A sending host with s2sd running under its root.
class Daemon {
  public:
    explicit Daemon(const Host& host) : host_(host), env_("S2S_ROOT", host.Root().c_str()) {}
    ~Daemon() { Stop(SIGTERM); }

    void Start() {
        const std::string socket = Socket();
        unlink(socket.c_str());
        child_.reset(new Child({Tool("s2sd"), "--delay", "1", "--verbose"}, host_.Env(),
                               host_.Root() + "/logs"));
        ASSERT_TRUE(WaitFor([&] { return IsPathThere(socket); })) << child_->Err();
    }
    int Stop(int signo) {
        if (!child_) {
            return -1;
        }
        child_->Signal(signo);
        const int status = child_->Wait();
        log_ += child_->Err();
        child_.reset();
        return status;
    }
    std::string Socket() const { return host_.Root() + Control::kSocketPath; }
    pid_t Pid() const { return child_ ? child_->Pid() : -1; }
    std::string Log() const { return log_ + (child_ ? child_->Err() : ""); }

    PObject Call(const PObject& request) {
        PObject reply;
        std::string error;
        EXPECT_EQ(Control::Request(request, reply, error), 0) << error;
        return reply;
    }

  private:
    const Host& host_;
    s2s_test::ScopedEnv env_;
    std::unique_ptr<Child> child_;
    std::string log_;
};

PObject Command(const char* command) {
    PObject request;
    request[Control::kKeyCommand] = command;
    return request;
}

PObject TaskRequest(const char* command, const std::vector<std::string>& shares, int mode) {
    PObject task;
    task["name"] = "nightly";
    task["server_ip"] = "127.0.0.1";
    task["user"] = kUser;
    task["schedule_mode"] = static_cast<unsigned long long>(mode);
    PObject::Array list;
    for (const std::string& share : shares) {
        list.push_back(PObject(share));
    }
    task["share_list"] = list;
    PObject request = Command(command);
    request[Control::kKeyTask] = task;
    request[Control::kKeyPassword] = kPassword;
    return request;
}

unsigned long long StatusOf(const PObject& reply) {
    return reply[Control::kKeyStatus].asUInt64();
}

class ControlSocket : public ::testing::Test {
  protected:
    ControlSocket() : host_("s2sd", "SN-S2SD"), daemon_(host_) {}
    void SetUp() override {
        host_.AddShare("docs");
        daemon_.Start();
    }

    Host host_;
    Daemon daemon_;
};

TEST_F(ControlSocket, HostileRequestsGetAClearErrorAndTheDaemonGoesOnServing) {
    struct stat st;
    ASSERT_EQ(stat(daemon_.Socket().c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);

    // A client that connects and says nothing holds no one up.
    S2S::IPCSender silent;
    ASSERT_EQ(silent.connect(daemon_.Socket()), 0);

    PObject nested = Command(Control::kList);
    PObject* inner = &nested["x"];
    for (int i = 0; i < 40; ++i) {
        (*inner)["y"] = PObject();
        inner = &(*inner)["y"];
    }
    PObject show_text = Command(Control::kShow);
    show_text[Control::kKeyTaskId] = "1";
    PObject add_text = Command(Control::kAdd);
    add_text[Control::kKeyTask] = "a task";
    PObject add_bad_key = TaskRequest(Control::kAdd, {"docs"}, 0);
    add_bad_key[Control::kKeyTask]["ssh_port"] = "22";
    PObject add_invalid = TaskRequest(Control::kAdd, {"nosuchshare"}, 0);
    PObject add_bad_name = TaskRequest(Control::kAdd, {"docs"}, 0);
    add_bad_name[Control::kKeyTask]["name"] = "../nightly";  // the receiver would refuse it
    PObject number_command;
    number_command[Control::kKeyCommand] = 5ULL;
    const struct {
        PObject request;
        unsigned long long status;
        const char* words;
    } cases[] = {
        {PObject("list"), Control::kBadRequest, "not a map"},
        {number_command, Control::kBadRequest, "command"},
        {Command("frobnicate"), Control::kBadRequest, "unknown command 'frobnicate'"},
        {show_text, Control::kBadRequest, "'task_id' must be an integer"},
        {add_text, Control::kBadRequest, "'task' must be a task map"},
        {add_bad_key, Control::kBadRequest, "'ssh_port' has the wrong type"},
        {add_invalid, Control::kInvalidTask, "share 'nosuchshare' is not valid"},
        {add_bad_name, Control::kInvalidTask, "not one a receiver takes"},
        {Command(Control::kShow), Control::kBadRequest, "'task_id' is missing"},
        {nested, Control::kTooLarge, "nests deeper"},
    };
    for (const auto& c : cases) {
        const PObject reply = daemon_.Call(c.request);
        EXPECT_EQ(StatusOf(reply), c.status) << c.request.toString();
        EXPECT_NE(reply[Control::kKeyMessage].asString().find(c.words), std::string::npos)
            << reply[Control::kKeyMessage].asString();
    }

    // 100 MB in one request.
    {
        PObject big = Command(Control::kList);
        PObject::Array chunks(1600, PObject(std::string(65000, 'x')));
        big["junk"] = chunks;
        S2S::IPCSender sender;
        ASSERT_EQ(sender.connect(daemon_.Socket()), 0);
        PObject reply;
        ASSERT_EQ(sender.send(big, true, reply), 0);
        EXPECT_EQ(StatusOf(reply), Control::kTooLarge) << reply.toString();
    }

    // 200 clients at once, each answered.
    {
        std::vector<std::unique_ptr<S2S::IPCSender>> clients;
        for (int i = 0; i < 200; ++i) {
            clients.emplace_back(new S2S::IPCSender);
            ASSERT_EQ(clients.back()->connect(daemon_.Socket()), 0) << i;
        }
        for (auto& client : clients) {
            ASSERT_EQ(client->send(Command(Control::kList)), 0);
        }
        for (auto& client : clients) {
            PObject reply;
            ASSERT_EQ(client->recv(reply), 0);
            EXPECT_EQ(StatusOf(reply), Control::kOk);
        }
    }

    // The silent client is told in the end, and the daemon still answers.
    PObject told;
    ASSERT_EQ(silent.recv(told), 0);
    EXPECT_EQ(StatusOf(told), Control::kBadRequest);
    EXPECT_NE(told[Control::kKeyMessage].asString().find("no complete request"), std::string::npos);

    const PObject added = daemon_.Call(TaskRequest(Control::kAdd, {"docs"}, 0));
    ASSERT_EQ(StatusOf(added), Control::kOk) << added.toString();
    PObject show = Command(Control::kShow);
    show[Control::kKeyTaskId] = added[Control::kKeyTaskId];
    const PObject shown = daemon_.Call(show);
    EXPECT_EQ(shown[Control::kKeyTask]["name"].asString(), "nightly");
    EXPECT_EQ(shown[Control::kKeyTask][Control::kKeyState].asString(), "idle");
    // The password is kept in a root-only file and never comes back.
    EXPECT_FALSE(shown[Control::kKeyTask].hasMember("pswd"));
    const std::string password_file = host_.Root() + Control::kPasswordDir + "/" +
                                      std::to_string(added[Control::kKeyTaskId].asUInt64());
    ASSERT_EQ(stat(password_file.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    EXPECT_EQ(daemon_.Log().find(kPassword), std::string::npos);

    // A second daemon on the same root, in the foreground or detaching, is refused before it
    // touches the socket; the first goes on serving.
    for (const char* mode : {"--verbose", "--daemon"}) {
        Child second({Tool("s2sd"), mode}, host_.Env(), host_.Root() + "/logs");
        EXPECT_EQ(second.Wait(), 1) << mode;
        EXPECT_NE(second.Err().find("s2sd is already running (pid " +
                                    std::to_string(daemon_.Pid()) + ")"),
                  std::string::npos)
            << second.Err();
    }
    EXPECT_EQ(StatusOf(daemon_.Call(Command(Control::kList))), Control::kOk);
    EXPECT_EQ(daemon_.Stop(SIGTERM), 0);
}

// A sending host with s2sd and a receiving host, in a network namespace of their own.
class DaemonScenario : public ::testing::Test {
  protected:
    void SetUp() override {
        if (!EnterPrivateNetwork()) {
            GTEST_SKIP() << "needs root and network namespaces";
        }
        receiver_.reset(new Receiver(kUser, kPassword));
        sender_.reset(new Sender("sender", "SN-SENDER-D", kPassword));
        sender_->AddShare("docs");
        receiver_->AddShare("docs");
        ASSERT_EQ(receiver_->Configure().status, 0);
        ASSERT_EQ(receiver_->Start().status, 0);
        daemon_.reset(new Daemon(*sender_));
        daemon_->Start();
    }

    // The runs of task `id`, newest first.
    PObject::Array Runs(const PObject& id) {
        PObject history = Command(Control::kHistory);
        history[Control::kKeyTaskId] = id;
        return daemon_->Call(history)[Control::kKeyRuns].asArray();
    }
    // Waits until task `id` has `count` runs, the newest one ended, and the task is no longer
    // running (the run is recorded a moment before its task is free to run again).
    bool WaitForRuns(const PObject& id, size_t count, std::chrono::seconds limit) {
        PObject status = Command(Control::kStatus);
        status[Control::kKeyTaskId] = id;
        return WaitFor(
            [&] {
                const PObject::Array runs = Runs(id);
                const PObject reply = daemon_->Call(status);
                const PObject::Array& tasks = reply[Control::kKeyTasks].asArray();
                return runs.size() >= count && runs[0][Control::kKeyEnd].asUInt64() != 0 &&
                       tasks.size() == 1 &&
                       tasks[0][Control::kKeyState].asString() != Control::kStateRunning;
            },
            limit);
    }

    std::unique_ptr<Receiver> receiver_;
    std::unique_ptr<Sender> sender_;
    std::unique_ptr<Daemon> daemon_;
};

// The "total size" (of the files in its list) that the sender's rsync logged for the run whose
// itemised lines name `path`; -1 when no such run is logged.
long long LoggedTotalSize(const std::string& log, const std::string& path) {
    std::istringstream in(log);
    std::string line;
    std::string pid;
    long long total = -1;
    while (std::getline(in, line)) {
        const size_t open = line.find('[');
        const size_t close = line.find(']', open);
        if (open == std::string::npos || close == std::string::npos) {
            continue;
        }
        const std::string id = line.substr(open, close - open);
        if (line.size() > path.size() &&
            line.compare(line.size() - path.size(), path.size(), path) == 0) {
            pid = id;
        }
        const size_t size = line.find("total size ");
        if (id == pid && size != std::string::npos) {
            total = std::stoll(line.substr(size + 11));
        }
    }
    return total;
}

TEST_F(DaemonScenario, RealTimeTaskSendsOnlyWhatChangedIncludingNewDirectoriesAndDeletions) {
    const std::string source = sender_->SharePath("docs");
    const std::string copy = receiver_->SharePath("docs");
    GenerateFiles(source, 200, 1000);
    const PObject added = daemon_->Call(TaskRequest(Control::kAdd, {"docs"}, 1));
    ASSERT_EQ(StatusOf(added), Control::kOk) << added.toString();
    const PObject id = added[Control::kKeyTaskId];
    // A new real-time task is synced whole at once.
    ASSERT_TRUE(WaitForRuns(id, 1, std::chrono::seconds(60))) << daemon_->Log();
    EXPECT_EQ(Runs(id)[0][Control::kKeyResult].asUInt64(), 0u) << daemon_->Log();

    MakeDirs(source + "/new");
    ASSERT_TRUE(WaitFor([&] { return IsPathThere(copy + "/new"); }, std::chrono::seconds(60)))
        << daemon_->Log();
    // The directory that appeared is watched too, and the run sends that one file, not the
    // share's 200 KB.
    WriteFile(source + "/new/later", "written later");
    ASSERT_TRUE(WaitFor([&] { return s2s_test::ReadFile(copy + "/new/later") == "written later"; },
                        std::chrono::seconds(60)))
        << daemon_->Log();
    const std::string log = s2s_test::ReadFile(sender_->Root() + "/var/log/s2s_rsync.log");
    EXPECT_EQ(LoggedTotalSize(log, "new/later"), 13) << log;
    // What rsync read for so short a run is counted once it has ended.
    ASSERT_TRUE(WaitForRuns(id, 3, std::chrono::seconds(60))) << daemon_->Log();
    EXPECT_GE(Runs(id)[0][Control::kKeyShares].asArray()[0][Control::kKeyReadBytes].asUInt64(), 13u)
        << Runs(id)[0].toString();

    // A file deleted on the sender goes from the receiver; the rest stays.
    ASSERT_EQ(unlink((source + "/file7").c_str()), 0);
    ASSERT_TRUE(WaitFor([&] { return !IsPathThere(copy + "/file7"); }, std::chrono::seconds(60)))
        << daemon_->Log();
    ASSERT_TRUE(WaitForRuns(id, 4, std::chrono::seconds(60))) << daemon_->Log();
    EXPECT_EQ(Manifest(copy), Manifest(source));

    // The share's folder goes away and comes back (a volume unmounted and mounted again): it is
    // watched again and what it holds then is synced.
    const std::string folder = source;
    const size_t runs = Runs(id).size();
    s2s_test::RemoveTree(folder);
    // The removal itself is a change; its run ends before the folder comes back.
    ASSERT_TRUE(WaitForRuns(id, runs + 1, std::chrono::seconds(60))) << daemon_->Log();
    MakeDirs(folder);
    WriteFile(folder + "/back", "after the return");
    EXPECT_TRUE(WaitFor([&] { return IsPathThere(receiver_->SharePath("docs") + "/back"); },
                        std::chrono::seconds(60)))
        << daemon_->Log();
    EXPECT_NE(daemon_->Log().find("[NOTE] realtime_watch.cpp"), std::string::npos);
}

TEST_F(DaemonScenario, ATasksGuardOptionsKeepTheReceiversCopyAndTheRefusalIsRecorded) {
    const std::string source = sender_->SharePath("docs");
    GenerateFiles(source, 5, 100);
    const PObject added = daemon_->Call(TaskRequest(Control::kAdd, {"docs"}, 0));
    ASSERT_EQ(StatusOf(added), Control::kOk) << added.toString();
    const PObject id = added[Control::kKeyTaskId];
    PObject run = Command(Control::kRun);
    run[Control::kKeyTaskId] = id;
    ASSERT_EQ(StatusOf(daemon_->Call(run)), Control::kOk);
    ASSERT_TRUE(WaitForRuns(id, 1, std::chrono::seconds(60))) << daemon_->Log();
    const auto copy = Manifest(receiver_->SharePath("docs"));
    ASSERT_EQ(copy.size(), 5u) << daemon_->Log();

    // The folder emptied: the run is refused and the receiver's copy stays whole.
    for (int i = 0; i < 5; ++i) {
        ASSERT_EQ(unlink((source + "/file" + std::to_string(i)).c_str()), 0);
    }
    ASSERT_EQ(StatusOf(daemon_->Call(run)), Control::kOk);
    ASSERT_TRUE(WaitForRuns(id, 2, std::chrono::seconds(60))) << daemon_->Log();
    PObject last = Runs(id)[0];
    EXPECT_EQ(last[Control::kKeyResult].asUInt64(),
              static_cast<unsigned long long>(S2S::RunFailure::kUnsafeSource));
    EXPECT_EQ(last[Control::kKeyShares].asArray()[0][Control::kKeyGuard].asString(), "empty-source")
        << last.toString();
    EXPECT_EQ(Manifest(receiver_->SharePath("docs")), copy);

    // Emptiness allowed but at most 2 deletions: refused by the limit, still nothing deleted.
    PObject update = TaskRequest(Control::kUpdate, {"docs"}, 0);
    update[Control::kKeyTaskId] = id;
    update[Control::kKeyTask][Control::kKeyAllowEmptySource] = true;
    update[Control::kKeyTask][Control::kKeyMaxDelete] = "2";
    ASSERT_EQ(StatusOf(daemon_->Call(update)), Control::kOk);
    ASSERT_EQ(StatusOf(daemon_->Call(run)), Control::kOk);
    ASSERT_TRUE(WaitForRuns(id, 3, std::chrono::seconds(60))) << daemon_->Log();
    last = Runs(id)[0];
    EXPECT_EQ(last[Control::kKeyResult].asUInt64(),
              static_cast<unsigned long long>(S2S::RunFailure::kMaxDelete));
    EXPECT_EQ(last[Control::kKeyShares].asArray()[0][Control::kKeyGuard].asString(), "max-delete");
    EXPECT_EQ(last[Control::kKeyShares].asArray()[0][Control::kKeyWouldDelete].asUInt64(), 5u);
    EXPECT_EQ(Manifest(receiver_->SharePath("docs")), copy);
    PObject status = Command(Control::kStatus);
    status[Control::kKeyTaskId] = id;
    const PObject entry = daemon_->Call(status)[Control::kKeyTasks].asArray()[0];
    EXPECT_EQ(entry[Control::kKeyLastResult].asUInt64(), last[Control::kKeyResult].asUInt64());
    EXPECT_NE(entry[Control::kKeyLastMessage].asString().find("delete"), std::string::npos)
        << entry.toString();

    // The options survive a restart; an update that leaves them out keeps them; a bad limit is
    // an invalid task.
    EXPECT_EQ(daemon_->Stop(SIGTERM), 0);
    daemon_->Start();
    update[Control::kKeyTask].asMap().erase(Control::kKeyAllowEmptySource);
    update[Control::kKeyTask].asMap().erase(Control::kKeyMaxDelete);
    ASSERT_EQ(StatusOf(daemon_->Call(update)), Control::kOk);
    PObject show = Command(Control::kShow);
    show[Control::kKeyTaskId] = id;
    const PObject task = daemon_->Call(show)[Control::kKeyTask];
    EXPECT_TRUE(task[Control::kKeyAllowEmptySource].asBool());
    EXPECT_EQ(task[Control::kKeyMaxDelete].asString(), "2");
    update[Control::kKeyTask][Control::kKeyMaxDelete] = "150%";
    const PObject refused = daemon_->Call(update);
    EXPECT_EQ(StatusOf(refused), Control::kInvalidTask);
    EXPECT_NE(refused[Control::kKeyMessage].asString().find("max_delete"), std::string::npos);
}

TEST_F(DaemonScenario, StoppedOrKilledDuringARunTheTaskAndHistorySurviveAndTheNextRunCompletes) {
    WriteRandomFile(sender_->SharePath("docs") + "/big", 300u << 20);
    PObject request = TaskRequest(Control::kAdd, {"docs"}, 0);
    request[Control::kKeyTask]["compress"] = 1ULL;
    const PObject added = daemon_->Call(request);
    ASSERT_EQ(StatusOf(added), Control::kOk) << added.toString();
    const PObject id = added[Control::kKeyTaskId];
    PObject run = Command(Control::kRun);
    run[Control::kKeyTaskId] = id;
    ASSERT_EQ(StatusOf(daemon_->Call(run)), Control::kOk);
    const auto copying = [&] {
        return WaitFor([&] { return HasPartialFile(receiver_->SharePath("docs")); },
                       std::chrono::seconds(60));
    };
    ASSERT_TRUE(copying()) << daemon_->Log();

    // SIGTERM: the transfer is cancelled, no rsync is left behind, the share is not complete.
    EXPECT_EQ(daemon_->Stop(SIGTERM), 0);
    EXPECT_TRUE(ProcessesMentioning(sender_->SharePath("docs")).empty());
    EXPECT_EQ(receiver_->Status().out.find("share: docs bound to SN-SENDER-D, last sync completed"),
              std::string::npos);
    daemon_->Start();
    ASSERT_EQ(StatusOf(daemon_->Call(run)), Control::kOk);
    // The copy is under way again (its progress shows in the status).
    PObject status = Command(Control::kStatus);
    status[Control::kKeyTaskId] = id;
    ASSERT_TRUE(WaitFor(
        [&] {
            const PObject reply = daemon_->Call(status);
            const PObject::Array& tasks = reply[Control::kKeyTasks].asArray();
            return tasks.size() == 1 && tasks[0][Control::kKeyShare].asString() == "docs" &&
                   tasks[0][Control::kKeyBytesDone].asUInt64() > 0;
        },
        std::chrono::seconds(60)))
        << daemon_->Log();

    EXPECT_EQ(daemon_->Stop(SIGKILL), 128 + SIGKILL);
    // SIGKILL leaves the daemon no chance to stop its rsync; the administrator's kill does.
    for (pid_t pid : ProcessesMentioning(sender_->SharePath("docs"))) {
        kill(pid, SIGKILL);
    }
    daemon_->Start();

    PObject show = Command(Control::kShow);
    show[Control::kKeyTaskId] = id;
    EXPECT_EQ(daemon_->Call(show)[Control::kKeyTask]["name"].asString(), "nightly");
    PObject::Array runs = Runs(id);
    ASSERT_EQ(runs.size(), 2u);
    EXPECT_EQ(runs[0][Control::kKeyResult].asUInt64(), 99u);  // interrupted
    EXPECT_NE(runs[0][Control::kKeyEnd].asUInt64(), 0u);
    EXPECT_EQ(runs[1][Control::kKeyResult].asUInt64(),
              static_cast<unsigned long long>(S2S::RunFailure::kCancelled));
    EXPECT_EQ(receiver_->Status().out.find("share: docs bound to SN-SENDER-D, last sync completed"),
              std::string::npos);

    ASSERT_EQ(StatusOf(daemon_->Call(run)), Control::kOk);
    ASSERT_TRUE(WaitForRuns(id, 3, std::chrono::seconds(300))) << daemon_->Log();
    runs = Runs(id);
    EXPECT_EQ(runs[0][Control::kKeyResult].asUInt64(), 0u) << runs[0].toString();
    EXPECT_EQ(Manifest(sender_->SharePath("docs")), Manifest(receiver_->SharePath("docs")));
    EXPECT_NE(receiver_->Status().out.find("share: docs bound to SN-SENDER-D, last sync completed"),
              std::string::npos);
}

}  // namespace
