// s2s-receiver: the command handlers on a real pairing store (strict reading of hostile command
// files, pairing with conflicts, old-server answers, share binding, heartbeats), the command
// module's hooks, and the program's configure / start / status / stop against a real daemon.
#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <netinet/in.h>

#include <list>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "gtest/gtest.h"
#include "receiver/internal.h"
#include "rsync/wrapper_fixture.h"
#include "s2s_receiver.h"
#include "s2s_rsync_wrapper.h"

namespace {

using S2S::ReceiverAnswer;
using S2S::ReceiverRunCommand;
using wrapper_test::CountEntries;
using wrapper_test::Server;

const std::string kToken = "0123456789abcdef0123456789abcdef";

std::string File(const std::vector<std::string>& lines) {
    std::string text = "token=\"" + kToken + "\"\n";
    for (const auto& l : lines) {
        text += l + "\n";
    }
    return text;
}

// One command from `client`: the command name, then key="value" pairs.
ReceiverAnswer Cmd(const std::string& client, const std::string& name,
                   const std::vector<std::pair<std::string, std::string>>& keys,
                   bool oldServer = false) {
    std::vector<std::string> lines = {"command=\"" + name + "\"", "clientID=\"" + client + "\""};
    for (const auto& k : keys) {
        lines.push_back(k.first + "=\"" + k.second + "\"");
    }
    return ReceiverRunCommand(File(lines), oldServer);
}

int Code(const std::string& client, const std::string& name,
         const std::vector<std::pair<std::string, std::string>>& keys, bool oldServer = false) {
    return Cmd(client, name, keys, oldServer).result;
}

int MultiPair(const std::string& client, const std::string& shares, std::string* output,
              bool dryRun = false) {
    ReceiverAnswer a = Cmd(client, "S2S_PairingMultiSrc",
                           {{"serverName", "host-" + client},
                            {"syncShares", shares},
                            {"dryRun", dryRun ? "yes" : "no"},
                            {"outfile", "/tmp/S2S/temp.x"}});
    *output = a.hasOutput ? a.output : "<none>";
    return a.result;
}

int Start(const std::string& client, const std::string& share) {
    return Code(client, "S2S_SyncStart", {{"volumeName", "volume1"}, {"shareName", share}});
}

int Finish(const std::string& client, const std::string& type, const std::string& share) {
    return Code(client, "S2S_SyncFinish", {{"finishType", type}, {"name", share}});
}

std::string ShareState(const std::string& name) {
    S2S::ReceiverStatus st;
    S2S::ReceiverGetStatus(&st);
    for (const auto& s : st.shares) {
        if (s.name == name) {
            return s.state + (s.owner.empty() ? "" : " " + s.owner);
        }
    }
    return "free";
}

bool IsThere(const std::string& path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

// Alive and not merely a zombie waiting for its new parent to reap it.
bool Alive(pid_t pid) {
    std::string stat = s2s_test::ReadFile("/proc/" + std::to_string(pid) + "/stat");
    size_t paren = stat.rfind(')');
    return paren != std::string::npos && paren + 2 < stat.size() && stat[paren + 2] != 'Z';
}

std::vector<pid_t> Children(pid_t pid) {
    std::vector<pid_t> out;
    std::istringstream in(s2s_test::ReadFile("/proc/" + std::to_string(pid) + "/task/" +
                                             std::to_string(pid) + "/children"));
    for (long child = 0; in >> child;) {
        out.push_back(static_cast<pid_t>(child));
    }
    return out;
}

class Handlers : public ::testing::Test {
  protected:
    void SetUp() override {
        server_.AddShare("photos");
        server_.AddShare("docs");
        server_.AddShare("vault", true);
        server_.AddShare("Ünïcødé");
    }
    Server server_;
};

TEST_F(Handlers, HostileCommandFilesAreRefusedWithTheirCode) {
    struct Case {
        std::string input;
        int code;
    };
    const std::string head = "token=\"" + kToken + "\"\n";
    const std::vector<Case> cases = {
        {head, 203},
        {head + "clientID=\"A\"\ncommand=\"S2S_GetProtocolVer\"\n", 203},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\noutfile=\"/x\"\noutfile=\"/y\"\n",
         203},
        {head + "command=\"S2S_GetProtocolVer\"\r\nclientID=\"A\"\n", 203},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\n\noutfile=\"/x\"\n", 203},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\noutfile=/x\n", 203},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\n1key=\"v\"\n", 203},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\noutfile=\"a\tb\"\n", 203},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"../../etc\"\noutfile=\"/x\"\n", 203},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"" + std::string(36, 'c') +
             "\"\noutfile=\"/x\"\n",
         203},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\n" + std::string(5000, 'x'), 203},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\n", 201},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\noutfile=\"\"\n", 201},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\noutfile=\"/x\"\nextra=\"1\"\n",
         202},
        {head + "command=\"rm -rf /\"\nclientID=\"A\"\n", 43},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\noutfile=\"/x\"", 203},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"S2SMULTI-SRC-SUPPORT\"\n"
                "outfile=\"/x\"\n",
         203},
        {head + "command=\"S2S_GetProtocolVer\"\nclientID=\"s2smulti-src-support\"\n"
                "outfile=\"/x\"\n",
         203},
    };
    for (const auto& c : cases) {
        ReceiverAnswer a = ReceiverRunCommand(c.input, false);
        EXPECT_EQ(a.result, c.code) << c.input.substr(0, 200);
        EXPECT_EQ(a.token, kToken) << "every answer goes back to its token";
    }
    // Without a valid token line no reply can be placed anywhere.
    for (const std::string& bad :
         {std::string("token=\"../../../etc\"\n"), "token=\"" + std::string(32, 'A') + "\"\n",
          std::string("command=\"S2S_GetProtocolVer\"\n"), std::string()}) {
        EXPECT_EQ(
            ReceiverRunCommand(bad + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\n", false)
                .token,
            "");
    }
}

TEST_F(Handlers, ShareNamesThatCouldEscapeAreRefused) {
    ASSERT_EQ(Code("A", "S2S_Pairing", {{"dryRun", "no"}, {"serverName", "host-a"}}), 0);
    for (std::string name :
         {"../photos", "photos/x", "..", "a\"b", "a'b", "@photos@", "a\x01z", "[global]", "a\\b"}) {
        EXPECT_EQ(Start("A", name), 204) << name;
        std::string out;
        EXPECT_EQ(MultiPair("A", "photos:" + name, &out), 204) << name;
    }
    EXPECT_EQ(Code("A", "S2S_UpdateTaskStatus", {{"taskName", "a\nb"}}), 203)
        << "a line break splits the command file";
    EXPECT_EQ(Code("A", "S2S_UpdateTaskStatus", {{"taskName", "t\x7f"}}), 204);
    for (std::string task : {"a/b", "..", "x..y", "@t", "../../etc"}) {
        EXPECT_EQ(Code("A", "S2S_UpdateTaskStatus", {{"taskName", task}}), 204) << task;
    }
    EXPECT_EQ(Start("A", "a  b"), 204) << "the daemon would serve it as 'a b'";
    EXPECT_EQ(Start("A", "Ünïcødé"), 0) << "non-ASCII names are fine";
}

TEST_F(Handlers, MultiSourcePairingReportsConflictsAndBindsShares) {
    std::string out;
    EXPECT_EQ(Code("A", "S2S_GetProtocolVer", {{"outfile", "/tmp/x"}}), 0);
    EXPECT_EQ(Cmd("A", "S2S_GetProtocolVer", {{"outfile", "/tmp/x"}}).output, "1\n");

    EXPECT_EQ(Start("A", "photos"), 208) << "no sync before pairing";
    EXPECT_EQ(MultiPair("A", "photos:docs", &out), 0);
    EXPECT_EQ(out, "\n");
    EXPECT_EQ(Start("A", "photos"), 0);
    EXPECT_EQ(ShareState("photos"), "running A");

    EXPECT_EQ(MultiPair("B", "docs:photos", &out, true), 214);
    EXPECT_EQ(out, "photos\n");
    EXPECT_EQ(MultiPair("B", "docs:photos", &out), 214);
    EXPECT_EQ(Start("B", "photos"), 214);
    EXPECT_EQ(Finish("B", "unpair", "photos"), 214) << "only the bound client may release it";
    EXPECT_EQ(Start("B", "docs"), 0);
    EXPECT_EQ(MultiPair("A", "photos:docs", &out), 214);
    EXPECT_EQ(out, "docs\n");

    EXPECT_EQ(Finish("A", "complete", "photos"), 0);
    EXPECT_EQ(ShareState("photos"), "completed A");
    EXPECT_EQ(Finish("A", "abort", "photos"), 0);
    EXPECT_EQ(ShareState("photos"), "completed A") << "the binding stays";
    S2S::ReceiverStatus aborted;
    ASSERT_EQ(S2S::ReceiverGetStatus(&aborted), 0);
    ASSERT_EQ(aborted.shares.size(), 2u);
    EXPECT_EQ(aborted.shares[0].name + " " + aborted.shares[0].lastResult, "photos abort")
        << "the latest sync's failure is what the status tells";
    EXPECT_GE(aborted.shares[0].lastTime, aborted.shares[0].lastStart);
    EXPECT_EQ(Finish("A", "later", "photos"), 211);
    EXPECT_EQ(Finish("A", "unpair", "photos"), 0);
    EXPECT_EQ(ShareState("photos"), "free");
    EXPECT_EQ(Start("B", "photos"), 0);

    S2S::ReceiverStatus st;
    ASSERT_EQ(S2S::ReceiverGetStatus(&st), 0);
    EXPECT_EQ(st.pairedClientID, "S2SMULTI-SRC-SUPPORT");
    ASSERT_EQ(st.clients.size(), 2u);
    EXPECT_EQ(st.clients[0].clientID + st.clients[0].serverName, "Ahost-A");
    EXPECT_FALSE(st.busy);
    EXPECT_EQ(Code("A", "S2S_UpdateTaskStatus", {{"taskName", "nightly"}}), 0);
    EXPECT_EQ(Code("C", "S2S_UpdateTaskStatus", {{"taskName", "nightly"}}), 208);
    ASSERT_EQ(S2S::ReceiverGetStatus(&st), 0);
    EXPECT_TRUE(st.busy);

    // What one client may create in the store is bounded: a task more than its share is refused
    // with its own code, known tasks and other clients go on.
    for (int i = 1; i < 64; ++i) {
        ASSERT_EQ(Code("A", "S2S_UpdateTaskStatus", {{"taskName", "t" + std::to_string(i)}}), 0);
    }
    EXPECT_EQ(Code("A", "S2S_UpdateTaskStatus", {{"taskName", "one-more"}}), 216);
    EXPECT_EQ(Code("A", "S2S_UpdateTaskStatus", {{"taskName", "nightly"}}), 0);
    EXPECT_EQ(Code("B", "S2S_UpdateTaskStatus", {{"taskName", "one-more"}}), 0);
}

// Every store write is a synced rewrite of the whole file. A resync repeats pairing, start and
// finish with the same values: those leave the file alone; only what changes is written.
TEST_F(Handlers, CommandsThatChangeNothingLeaveTheStoreAlone) {
    const std::string store = S2SPath(S2S_PATH_PAIRING_STORE);
    // A rewrite is a new file renamed over the old one: a new change time (the inode number alone
    // may come round again).
    auto version = [&] {
        struct stat st;
        if (stat(store.c_str(), &st) != 0) {
            return std::string();
        }
        return std::to_string(st.st_ino) + ":" + std::to_string(st.st_ctim.tv_sec) + "." +
               std::to_string(st.st_ctim.tv_nsec);
    };
    std::string out;
    ASSERT_EQ(MultiPair("A", "photos", &out), 0);
    ASSERT_EQ(Start("A", "photos"), 0);
    ASSERT_EQ(Finish("A", "complete", "photos"), 0);
    const auto written = version();
    ASSERT_NE(written, "");

    EXPECT_EQ(MultiPair("A", "photos", &out), 0);
    EXPECT_EQ(MultiPair("A", "photos", &out, true), 0);
    EXPECT_EQ(version(), written) << "a pairing that changes nothing rewrote the store";
    EXPECT_EQ(Finish("A", "abort", "photos"), 0);
    EXPECT_NE(version(), written) << "every finish is recorded with its result and time";
    EXPECT_EQ(ShareState("photos"), "completed A");

    EXPECT_EQ(MultiPair("A", "photos", &out, false), 0);
    EXPECT_EQ(Cmd("A", "S2S_PairingMultiSrc",
                  {{"serverName", "renamed"},
                   {"syncShares", "photos"},
                   {"dryRun", "no"},
                   {"outfile", "/x"}})
                  .result,
              0);
    const auto renamed = version();
    EXPECT_NE(renamed, written) << "a new server name must be stored";
    S2S::ReceiverStatus st;
    ASSERT_EQ(S2S::ReceiverGetStatus(&st), 0);
    ASSERT_EQ(st.clients.size(), 1u);
    EXPECT_EQ(st.clients[0].serverName, "renamed");

    EXPECT_EQ(Start("B", "docs"), 208);
    EXPECT_EQ(Start("A", "docs"), 0) << "a share bound for the first time";
    EXPECT_NE(version(), renamed);
    EXPECT_EQ(ShareState("docs"), "running A");
    const auto started = version();
    EXPECT_EQ(Code("A", "S2S_UpdateTaskStatus", {{"taskName", "t"}}), 0);
    EXPECT_NE(version(), started) << "the heartbeat is written every time";
}

TEST_F(Handlers, SyncStartChecksShareAndAttributes) {
    ASSERT_EQ(Code("A", "S2S_Pairing", {{"dryRun", "no"}, {"serverName", "host-a"}}), 0);
    auto attrs = [](const std::string& share, const std::string& enc) {
        return std::vector<std::pair<std::string, std::string>>{
            {"volumeName", "volume1"}, {"shareName", share}, {"isEncrypt", enc},
            {"isAutomount", "0"},      {"isEnableACL", "1"}, {"isWinShare", "0"},
            {"lenEncKey", "32"}};
    };
    EXPECT_EQ(Code("A", "S2S_SyncStart", attrs("photos", "0")), 0);
    EXPECT_EQ(Code("A", "S2S_SyncStart", attrs("vault", "1")), 0);
    EXPECT_EQ(Code("A", "S2S_SyncStart", attrs("vault", "0")), 210);
    EXPECT_EQ(Code("A", "S2S_SyncStart", attrs("nosuch", "0")), 209);
    EXPECT_EQ(Code("A", "S2S_SyncStart", attrs("photos", "yes")), 203);
    auto partial = attrs("photos", "0");
    partial.pop_back();
    EXPECT_EQ(Code("A", "S2S_SyncStart", partial), 201);
    EXPECT_EQ(Code("A", "S2S_SyncStart", {{"shareName", "photos"}}), 201);
}

TEST_F(Handlers, OldServerAnswersLikeOne) {
    std::string out;
    EXPECT_EQ(Code("A", "S2S_GetProtocolVer", {{"outfile", "/tmp/x"}}, true), 43);
    EXPECT_EQ(
        Cmd("A", "S2S_PairingMultiSrc",
            {{"serverName", "h"}, {"syncShares", "photos"}, {"dryRun", "no"}, {"outfile", "/x"}},
            true)
            .result,
        43);
    EXPECT_EQ(Code("A", "S2S_Pairing", {{"dryRun", "yes"}, {"serverName", "host-a"}}, true), 0);
    EXPECT_EQ(Code("A", "S2S_Pairing", {{"dryRun", "no"}, {"serverName", "host-a"}}, true), 0);
    EXPECT_EQ(Code("B", "S2S_Pairing", {{"dryRun", "yes"}, {"serverName", "host-b"}}, true), 207);
    EXPECT_EQ(Code("B", "S2S_Pairing", {{"dryRun", "no"}, {"serverName", "host-b"}}, true), 207);
    EXPECT_EQ(Code("A", "S2S_Pairing", {{"dryRun", "no"}, {"serverName", "host-a"}}, true), 0);
    EXPECT_EQ(Code("A", "S2S_Pairing", {{"dryRun", "maybe"}, {"serverName", "h"}}, true), 203);

    EXPECT_EQ(Code("A", "S2S_SyncStart",
                   {{"volumeName", "volume1"},
                    {"shareName", "photos"},
                    {"isEncrypt", "0"},
                    {"isAutomount", "0"},
                    {"isEnableACL", "0"},
                    {"isWinShare", "0"},
                    {"lenEncKey", "0"}},
                   true),
              202);
    EXPECT_EQ(Start("A", "photos"), 0);
    S2S::ReceiverStatus st;
    ASSERT_EQ(S2S::ReceiverGetStatus(&st), 0);
    EXPECT_EQ(st.pairedClientID, "A");
    EXPECT_EQ(st.pairedServerName, "host-a");

    // A current server takes the old single client over into the multi-client scheme.
    EXPECT_EQ(MultiPair("B", "docs", &out), 0);
    ASSERT_EQ(S2S::ReceiverGetStatus(&st), 0);
    EXPECT_EQ(st.pairedClientID, "S2SMULTI-SRC-SUPPORT");
    EXPECT_EQ(st.clients.size(), 2u);
    EXPECT_EQ(MultiPair("B", "photos", &out), 214);
}

// A stand-in for a daemon connection process: alive until End().
class Connection {
  public:
    Connection() {
        pid_ = fork();
        if (pid_ == 0) {
            pause();
            _exit(0);
        }
    }
    ~Connection() { End(); }
    Connection(const Connection&) = delete;
    Connection& operator=(const Connection&) = delete;
    std::string Id() const { return std::to_string(pid_); }
    void End() {
        if (pid_ > 0) {
            kill(pid_, SIGKILL);
            waitpid(pid_, nullptr, 0);
            pid_ = -1;
        }
    }

  private:
    pid_t pid_ = -1;
};

// The early hook writes only below the spool, only under a valid token, never twice into one
// reply, and its reply goes the moment its connection ends.
TEST_F(Handlers, EarlyHookAnswersIntoTheSpoolOnly) {
    ASSERT_EQ(server_.Configure().status, 0);
    auto hook = [](const std::string& input, const std::string& conn) {
        s2s_test::ScopedEnv pid("RSYNC_PID", conn.c_str());
        int fds[2];
        EXPECT_EQ(pipe(fds), 0);
        EXPECT_EQ(write(fds[1], input.data(), input.size()), static_cast<ssize_t>(input.size()));
        close(fds[1]);
        int rc = S2S::ReceiverHookEarly(fds[0], false);
        close(fds[0]);
        return rc;
    };
    const std::string replies = server_.Spool() + "/replies";
    const std::string conns = server_.Spool() + "/conns";
    std::string cmd = "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\noutfile=\"/x\"\n";
    Connection first;
    Connection second;
    EXPECT_EQ(hook("token=\"../../../../tmp/evil\"\n" + cmd, first.Id()), 1);
    EXPECT_EQ(hook("token=\"" + kToken + "\"\n" + cmd, "../x"), 1);
    EXPECT_EQ(hook("token=\"" + kToken + "\"\n" + cmd, "999999999"), 1) << "no such connection";
    EXPECT_EQ(CountEntries(replies), 0u);
    EXPECT_EQ(hook("token=\"" + kToken + "\"\n" + cmd, first.Id()), 0);
    EXPECT_EQ(s2s_test::ReadFile(replies + "/" + kToken + "/result"), "0\n");
    EXPECT_EQ(s2s_test::ReadFile(replies + "/" + kToken + "/output"), "1\n");
    EXPECT_EQ(hook("token=\"" + kToken + "\"\n" + cmd, second.Id()), 1) << "a replayed token";

    // The module's unprivileged reader may enter the replies but not list them; nobody else gets
    // past the spool.
    struct stat st;
    ASSERT_EQ(stat(server_.Spool().c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0700u);
    ASSERT_EQ(stat(replies.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0711u);
    ASSERT_EQ(stat((replies + "/" + kToken + "/result").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0644u);

    {
        // The hooks of configurations written by earlier versions still work.
        s2s_test::ScopedEnv pid("RSYNC_PID", first.Id().c_str());
        s2s_test::ScopedEnv other("RSYNC_REQUEST", "@s2s-cmd/ffffffffffffffffffffffffffffffff/");
        EXPECT_NE(S2S::ReceiverHookPre(), 0) << "another connection's reply";
        s2s_test::ScopedEnv own("RSYNC_REQUEST", ("@s2s-cmd/" + kToken + "/").c_str());
        EXPECT_EQ(S2S::ReceiverHookPre(), 0);
    }

    // The watcher the hook left removes reply and record as soon as the connection ends.
    EXPECT_EQ(CountEntries(conns), 1u);
    first.End();
    EXPECT_TRUE(
        s2s_test::WaitFor([&] { return CountEntries(replies) == 0 && CountEntries(conns) == 0; }));

    // A record whose connection has ended (its watcher gone with a stopped daemon) goes with the
    // next command.
    const std::string other = "fedcba9876543210fedcba9876543210";
    wrapper_test::MakeDirs(replies + "/" + other);
    s2s_test::WriteFile(replies + "/" + other + "/result", "0\n");
    s2s_test::WriteFile(conns + "/" + second.Id(), other + "\n1\n");
    EXPECT_EQ(hook("token=\"" + kToken + "\"\n" + cmd, second.Id()), 0);
    EXPECT_FALSE(IsThere(replies + "/" + other)) << "the ended connection's reply stayed";
    EXPECT_EQ(s2s_test::ReadFile(replies + "/" + kToken + "/result"), "0\n");
    second.End();
    EXPECT_TRUE(
        s2s_test::WaitFor([&] { return CountEntries(replies) == 0 && CountEntries(conns) == 0; }));
}

TEST(ReceiverTool, ConfigureWritesModulesAndAPrivateSecret) {
    Server server("s2suser", "pw with spaces:and:colons");
    server.AddShare("photos");
    server.AddShare("vault", true);
    server.AddShare("global");
    ASSERT_EQ(server.Configure().status, 0);
    const std::string conf = s2s_test::ReadFile(server.Root() + "/usr/vurn/etc/s2s_rsyncd.conf");
    for (const std::string& needle : std::vector<std::string>{
             "[@s2s-cmd]", "[@s2s-key]", "[photos]\n\tpath = " + server.SharePath("photos"),
             "[@vault@]\n\tpath = " + server.EncryptedPath("vault"), "use chroot = yes",
             "pid file = " + server.Root() + "/var/run/rsyncd.pid",
             "port = " + std::to_string(server.Port())}) {
        EXPECT_NE(conf.find(needle), std::string::npos) << needle << "\n" << conf;
    }
    EXPECT_EQ(conf.find("[global]"), std::string::npos) << "a share named global";
    EXPECT_EQ(conf.find("pw with"), std::string::npos);
    // Defensive modules: shares are pushed into, never read back, and drop setuid and setgid
    // bits (of directories too); keys
    // arrive private, through a hook that checks the destination; connections are limited.
    for (const std::string& needle : std::vector<std::string>{
             "[photos]\n\tpath = " + server.SharePath("photos") +
                 "\n\twrite only = yes\n\tincoming chmod = Dug-s,Fug-s\n",
             "\twrite only = yes\n\tincoming chmod = D700,F600\n\tpre-xfer exec = ", "hook-key\n",
             "max connections = 16\n"}) {
        EXPECT_NE(conf.find(needle), std::string::npos) << needle << "\n" << conf;
    }
    struct stat cs;
    ASSERT_EQ(stat((server.Root() + "/usr/vurn/etc/s2s_rsyncd.conf").c_str(), &cs), 0);
    EXPECT_EQ(cs.st_mode & 0777, 0600u);
    const std::string secrets = server.Root() + "/usr/vurn/etc/s2s_rsyncd.secrets";
    EXPECT_EQ(s2s_test::ReadFile(secrets), "s2suser:pw with spaces:and:colons\n");
    struct stat st;
    ASSERT_EQ(stat(secrets.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    // A password file with CR LF line ends gives the password the sender reads from it.
    wrapper_test::Run crlf = server.Tool(
        {"configure", "--user", "s2suser", "--port", std::to_string(server.Port())}, "pw crlf\r\n");
    EXPECT_EQ(crlf.status, 0) << crlf.output;
    EXPECT_EQ(s2s_test::ReadFile(secrets), "s2suser:pw crlf\n");

    EXPECT_NE(server.Tool({"configure", "--user", "bad:user"}, "pw\n").status, 0);
    EXPECT_NE(server.Tool({"configure", "--user", "u"}, "").status, 0) << "no password";
    EXPECT_NE(server.Tool({"configure", "--user", "u", "--port", "70000"}, "pw\n").status, 0);
    EXPECT_NE(server.Tool({"start", "now"}).status, 0);
    wrapper_test::Run help = server.Tool({"--help"});
    EXPECT_EQ(help.status, 0);
    EXPECT_EQ(help.output.compare(0, 19, "usage: s2s-receiver"), 0) << help.output;

    // A key directory an earlier version left open is made private again.
    chmod(server.KeyDir().c_str(), 0755);
    s2s_test::WriteFile(server.KeyDir() + "/old.key", "k");
    chmod((server.KeyDir() + "/old.key").c_str(), 0644);
    ASSERT_EQ(server.Configure().status, 0);
    ASSERT_EQ(stat(server.KeyDir().c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0700u);
    ASSERT_EQ(stat((server.KeyDir() + "/old.key").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);

    // Two shares the daemon would serve as one module (a registry edited by hand): refused,
    // and the configuration written before stays.
    s2s_test::WriteFile(server.Root() + "/etc/s2s/shares.conf",
                        "[docs]\n\tpath=\"" + server.SharePath("photos") +
                            "\"\n[DO CS]\n\tpath=\"" + server.SharePath("vault") + "\"\n");
    wrapper_test::Run clash = server.Configure();
    EXPECT_NE(clash.status, 0);
    EXPECT_NE(clash.output.find("'docs' and 'DO CS' would be served as one module"),
              std::string::npos)
        << clash.output;
    EXPECT_EQ(clash.output.find(".cpp("), std::string::npos) << "plain words on the terminal";
    EXPECT_EQ(s2s_test::ReadFile(server.Root() + "/usr/vurn/etc/s2s_rsyncd.conf"), conf);
}

TEST(ReceiverTool, StartStatusStop) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "the daemon needs root";
    }
    Server server;
    server.AddShare("photos");
    EXPECT_NE(server.Tool({"start"}).status, 0) << "not configured yet";
    ASSERT_EQ(server.Start(), "");
    const std::string pidFile = server.Root() + "/var/run/rsyncd.pid";
    EXPECT_NE(s2s_test::ReadFile(pidFile), "");
    wrapper_test::Run again = server.Tool({"start"});
    EXPECT_NE(again.status, 0);
    EXPECT_NE(again.output.find("running already"), std::string::npos) << again.output;

    // A paired client with a bound share shows in the status.
    std::string dir = server.Root() + "/client";
    wrapper_test::MakeDirs(dir);
    auto send = [&](std::list<std::string> lines) {
        VURN::Backup::RsyncWrapper w;
        server.Aim(w, "");
        w.setVurnCustCmdRule(lines);
        return w.execute(boost::function<bool()>());
    };
    EXPECT_EQ(send({"command=\"S2S_PairingMultiSrc\"", "clientID=\"SN1\"", "serverName=\"sender\"",
                    "syncShares=\"photos\"", "dryRun=\"no\"", "outfile=\"" + dir + "/conflicts\""}),
              0);
    EXPECT_EQ(s2s_test::ReadFile(dir + "/conflicts"), "\n");
    EXPECT_EQ(send({"command=\"S2S_SyncStart\"", "clientID=\"SN1\"", "volumeName=\"volume1\"",
                    "shareName=\"photos\""}),
              0);
    EXPECT_EQ(send({"command=\"S2S_UpdateTaskStatus\"", "clientID=\"SN1\"", "taskName=\"t1\""}), 0);
    wrapper_test::Run status = server.Tool({"status"});
    EXPECT_EQ(status.status, 0);
    const std::string head =
        "service: running\ntransfers: none running\npairing: multi-client\nclient: SN1 "
        "sender\nshare: photos bound to SN1, last sync started ";
    EXPECT_EQ(status.output.compare(0, head.size(), head), 0) << status.output;
    EXPECT_NE(status.output.find(", not finished\n"), std::string::npos) << status.output;

    ASSERT_EQ(server.Tool({"stop"}).status, 0);
    EXPECT_NE(access(pidFile.c_str(), F_OK), 0);
    status = server.Tool({"status"});
    EXPECT_EQ(status.output.compare(0, 41, "service: stopped\ntransfers: none running\n"), 0)
        << status.output;
    EXPECT_EQ(server.Tool({"stop"}).status, 0) << "stopping a stopped daemon is fine";

    // A pairing store that cannot be read: start refuses and leaves nothing running, status
    // still tells what runs, and stop stops.
    const std::string store = server.Root() + "/usr/vurn/etc/vurnS2S.info";
    const std::string good = s2s_test::ReadFile(store);
    s2s_test::WriteFile(store, "this is no section file\n");
    wrapper_test::Run refused = server.Tool({"start"});
    EXPECT_NE(refused.status, 0);
    EXPECT_NE(refused.output.find("cannot be written"), std::string::npos) << refused.output;
    EXPECT_FALSE(S2S::ReceiverRunning());
    s2s_test::WriteFile(store, good);
    ASSERT_EQ(server.Tool({"start"}).status, 0);
    s2s_test::WriteFile(store, "this is no section file\n");
    status = server.Tool({"status"});
    EXPECT_NE(status.status, 0);
    EXPECT_EQ(status.output.compare(0, 17, "service: running\n"), 0) << status.output;
    EXPECT_NE(status.output.find("cannot be read"), std::string::npos) << status.output;
    wrapper_test::Run stopped = server.Tool({"stop"});
    EXPECT_EQ(stopped.status, 0) << stopped.output;
    EXPECT_NE(stopped.output.find("the daemon is stopped"), std::string::npos) << stopped.output;
    EXPECT_FALSE(S2S::ReceiverRunning());
    s2s_test::WriteFile(store, good);
}

// Two starts at once: one daemon runs afterwards, and the loser says why.
TEST(ReceiverTool, ConcurrentStartsLeaveOneDaemonRunning) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "the daemon needs root";
    }
    Server server;
    ASSERT_EQ(server.Configure().status, 0);
    wrapper_test::Run results[2];
    std::vector<std::thread> starts;
    for (auto& r : results) {
        starts.emplace_back([&server, &r] { r = server.Tool({"start"}); });
    }
    for (auto& t : starts) {
        t.join();
    }
    EXPECT_EQ(results[0].status + results[1].status, 1) << results[0].output << results[1].output;
    EXPECT_TRUE(S2S::ReceiverRunning());
    EXPECT_EQ(server.Tool({"stop"}).status, 0);
}

// A stop ends the connections the daemon forked, not only the daemon: a transfer must not go on
// writing into a share of a stopped service.
TEST(ReceiverTool, StopEndsTheDaemonsConnections) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "the daemon needs root";
    }
    Server server;
    server.AddShare("photos");
    ASSERT_EQ(server.Start(), "");
    const pid_t daemon = std::stoi(s2s_test::ReadFile(server.Root() + "/var/run/rsyncd.pid"));

    // Two connections that have been greeted (so the daemon has forked a process for each) and
    // then stay silent, as a client in the middle of a long transfer would.
    std::vector<int> conns;
    for (int i = 0; i < 2; ++i) {
        int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        ASSERT_GE(fd, 0);
        conns.push_back(fd);
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        addr.sin_port = htons(static_cast<uint16_t>(server.Port()));
        ASSERT_EQ(connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
        char greeting[64];
        ASSERT_GT(read(fd, greeting, sizeof greeting), 0);
        EXPECT_EQ(std::string(greeting, 8), "@RSYNCD:");
        timeval limit{10, 0};
        setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    }
    std::vector<pid_t> children;
    ASSERT_TRUE(s2s_test::WaitFor([&] {
        children = Children(daemon);
        return children.size() == 2;
    }));

    ASSERT_EQ(server.Tool({"stop"}).status, 0);
    EXPECT_FALSE(Alive(daemon));
    for (pid_t child : children) {
        EXPECT_FALSE(Alive(child)) << "connection process " << child << " outlived the stop";
    }
    for (int fd : conns) {
        char byte;
        EXPECT_EQ(read(fd, &byte, 1), 0) << "the connection was closed";
        close(fd);
    }
    EXPECT_NE(access((server.Root() + "/var/run/rsyncd.pid").c_str(), F_OK), 0);
    EXPECT_EQ(server.Tool({"stop"}).status, 0);
}

// A client that sends a valid command but then asks for the whole command module (to learn
// other clients' tokens) or for a pattern gets nothing: the module reads as an unprivileged user
// that cannot list the replies. Its own reply it reads by its token.
TEST(ReceiverTool, CommandModuleServesRepliesByTokenOnly) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "the daemon needs root";
    }
    Server server;
    ASSERT_EQ(server.Start(), "");
    const std::string secret = "0badc0de0badc0de0badc0de0badc0de";
    wrapper_test::MakeDirs(server.Spool() + "/replies/" + secret);
    s2s_test::WriteFile(server.Spool() + "/replies/" + secret + "/output", "conflicts\n");
    chmod((server.Spool() + "/replies/" + secret + "/output").c_str(), 0644);

    s2s_test::ScopedEnv password("RSYNC_PASSWORD", server.Password().c_str());
    const std::string base =
        "rsync://" + server.User() + "@127.0.0.1:" + std::to_string(server.Port()) + "/@s2s-cmd/";
    int n = 0;
    auto ask = [&](const std::string& request) {
        const std::string token = "00000000000000000000000000000" + std::to_string(100 + n);
        const std::string input = server.Root() + "/input" + std::to_string(n);
        const std::string dest = server.Root() + "/got" + std::to_string(n++);
        s2s_test::WriteFile(input, "token=\"" + token +
                                       "\"\ncommand=\"S2S_GetProtocolVer\"\nclientID=\"A\"\n"
                                       "outfile=\"/x\"\n");
        std::string path = request == "own" ? token + "/" : request;
        wrapper_test::Run r = wrapper_test::RunProgram(
            {"/usr/bin/rsync", "-r", "--early-input=" + input, base + path, dest + "/"});
        EXPECT_EQ(r.output.find(secret), std::string::npos) << r.output;
        return std::make_pair(r.status, CountEntries(dest));
    };
    auto listed = ask("");
    EXPECT_NE(listed.first, 0);
    EXPECT_EQ(listed.second, 0u) << "the command module was listed";
    auto pattern = ask("*");
    EXPECT_NE(pattern.first, 0);
    EXPECT_EQ(pattern.second, 0u);
    auto own = ask("own");
    EXPECT_EQ(own.first, 0);
    EXPECT_EQ(own.second, 2u) << "result and output";
}

// What a client can do through the daemon: push into the shares the registry has (also one
// registered after start), never create device files or setuid programs there, never read a
// share back, and write a key only into an encrypted share's key directory, private to root.
// A transfer in progress shows in the status.
TEST(ReceiverTool, TheDaemonTakesOnlyWhatItShould) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "the daemon needs root";
    }
    Server server;
    server.AddShare("photos");
    server.AddShare("vault", true);
    ASSERT_EQ(server.Start(), "");
    s2s_test::ScopedEnv password("RSYNC_PASSWORD", server.Password().c_str());
    const std::string base =
        "rsync://" + server.User() + "@127.0.0.1:" + std::to_string(server.Port()) + "/";
    auto rsync = [](std::vector<std::string> args) {
        args.insert(args.begin(), "/usr/bin/rsync");
        return wrapper_test::RunProgram(args);
    };
    const std::string src = server.Root() + "/src";
    wrapper_test::MakeDirs(src);
    s2s_test::WriteFile(src + "/f", "data");

    // A run pairs before its first dry run or data run: the pairing alone brings the served
    // shares up to date, for a share registered after start as for one removed since.
    server.AddShare("late");
    ASSERT_EQ(VURNShareRemove("vault"), 0);
    VURN::Backup::RsyncWrapper w;
    server.Aim(w, "");
    w.setVurnCustCmdRule(
        {"command=\"S2S_Pairing\"", "clientID=\"SN1\"", "dryRun=\"no\"", "serverName=\"sender\""});
    ASSERT_EQ(w.execute(boost::function<bool()>()), 0);
    wrapper_test::Run late = rsync({"-r", src + "/", base + "late/"});
    EXPECT_EQ(late.status, 0) << "a share registered after start is served: " << late.output;
    EXPECT_EQ(s2s_test::ReadFile(server.SharePath("late") + "/f"), "data");
    EXPECT_EQ(rsync({"-r", src + "/", base + "vault/"}).status, 5) << "a removed share is served";
    server.AddShare("vault", true);
    w.setVurnCustCmdRule({"command=\"S2S_SyncStart\"", "clientID=\"SN1\"", "volumeName=\"volume1\"",
                          "shareName=\"vault\""});
    EXPECT_EQ(w.execute(boost::function<bool()>()), 0);

    ASSERT_EQ(mknod((src + "/null").c_str(), S_IFCHR | 0666, makedev(1, 3)), 0);
    s2s_test::WriteFile(src + "/suid", "#!/bin/sh\n");
    chmod((src + "/suid").c_str(), 04755);
    wrapper_test::MakeDirs(src + "/sgid");
    chmod((src + "/sgid").c_str(), 02755);
    wrapper_test::Run special = rsync({"-r", "--perms", "--owner", "--group", "--devices",
                                       "--specials", src + "/", base + "photos/"});
    EXPECT_EQ(special.status, 23) << special.output;
    EXPECT_FALSE(IsThere(server.SharePath("photos") + "/null")) << "a device file was created";
    struct stat st;
    ASSERT_EQ(stat((server.SharePath("photos") + "/suid").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0755u);
    ASSERT_EQ(stat((server.SharePath("photos") + "/sgid").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0755u) << "a setgid directory arrived";
    EXPECT_NE(rsync({"-r", base + "photos/", server.Root() + "/back/"}).status, 0)
        << "a share was read back";

    const std::string key = server.Root() + "/vault.key";
    s2s_test::WriteFile(key, "secret key");
    chmod(key.c_str(), 0644);
    wrapper_test::Run wrong = rsync({"--perms", key, base + "@s2s-key/photos/"});
    EXPECT_NE(wrong.status, 0);
    EXPECT_NE(wrong.output.find("encrypted share"), std::string::npos) << wrong.output;
    EXPECT_NE(rsync({"--perms", key, base + "@s2s-key/"}).status, 0);
    EXPECT_EQ(CountEntries(server.KeyDir()), 0u);
    ASSERT_EQ(rsync({"--perms", key, base + "@s2s-key/vault/"}).status, 0);
    ASSERT_EQ(stat((server.KeyDir() + "/vault/vault.key").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);

    // A transfer held back by a bandwidth limit is running until it is ended.
    s2s_test::WriteFile(src + "/big", std::string(1 << 20, 'b'));
    pid_t slow = fork();
    if (slow == 0) {
        execl("/usr/bin/rsync", "rsync", "-r", "--bwlimit=1", (src + "/big").c_str(),
              (base + "late/").c_str(), static_cast<char*>(nullptr));
        _exit(127);
    }
    S2S::ReceiverStatus now;
    EXPECT_TRUE(s2s_test::WaitFor([&] {
        S2S::ReceiverGetStatus(&now);
        return now.transfers == 1;
    }));
    kill(slow, SIGKILL);
    waitpid(slow, nullptr, 0);
    EXPECT_TRUE(s2s_test::WaitFor([&] {
        S2S::ReceiverGetStatus(&now);
        return now.transfers == 0;
    }));
}

TEST(ReceiverTool, StartFailsWhenThePortIsTaken) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "the daemon needs root";
    }
    Server server;
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    addr.sin_port = htons(static_cast<uint16_t>(server.Port()));
    int one = 1;
    setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
    ASSERT_EQ(bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    ASSERT_EQ(listen(fd, 1), 0);
    std::string error = server.Start();
    close(fd);
    EXPECT_NE(error, "");
    EXPECT_FALSE(S2S::ReceiverRunning());
}

TEST(ReceiverTool, OldServerModeThroughTheDaemon) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "the daemon needs root";
    }
    Server server;
    server.AddShare("photos");
    ASSERT_EQ(server.Start(true), "");
    VURN::Backup::RsyncWrapper w;
    server.Aim(w, "");
    w.setVurnCustCmdRule({"command=\"S2S_GetProtocolVer\"", "clientID=\"SN1\"",
                          "outfile=\"" + server.Root() + "/v\""});
    EXPECT_EQ(w.execute(boost::function<bool()>()), 43);
    EXPECT_EQ(s2s_test::ReadFile(server.Root() + "/v"), "");
}

}  // namespace
