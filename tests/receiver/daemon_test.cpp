// s2s-receiver and its rsync daemon as a client meets them: the configuration it writes, start /
// status / stop (one daemon, connections ended with it, an unreadable pairing store), and what a
// client can and cannot do through the daemon (replies by token, pushes, keys, old-server answers).
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <thread>

#include "s2s_platform.h"
#include "support/server_pair.h"
#include "support/tree_manifest.h"

namespace {

namespace fs = std::filesystem;

using s2s_test::ProgramResult;
using s2s_test::ReadFile;
using s2s_test::WriteFile;

const s2s_test::ShareAttrs encrypted = [] {
    s2s_test::ShareAttrs attrs;
    attrs.encrypted = true;
    return attrs;
}();

mode_t Mode(const std::string& path) {
    struct stat st = {};
    return stat(path.c_str(), &st) == 0 ? st.st_mode & 07777 : 01000000;
}

class Receiver : public ::testing::Test {
  protected:
    Receiver() : r_(pair_.Receiver()) {}
    ~Receiver() override { Tool({"stop"}); }
    // A TCP socket bound to (`listen`) or connected to the daemon's address.
    int Socket(bool listen) {
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        addr.sin_port = htons(static_cast<uint16_t>(pair_.Port()));
        const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        const sockaddr* a = reinterpret_cast<sockaddr*>(&addr);
        EXPECT_EQ(listen ? bind(fd, a, sizeof addr) + ::listen(fd, 1) : connect(fd, a, sizeof addr),
                  0);
        return fd;
    }
    ProgramResult Tool(const std::vector<std::string>& args, const std::string& input = "") {
        return r_.Run("s2s-receiver", args, input);
    }
    // rsync as a client of the daemon, with the account's password.
    ProgramResult Rsync(std::vector<std::string> args) {
        args.insert(args.begin(), "/usr/bin/rsync");
        return s2s_test::RunProgram(args, {{"RSYNC_PASSWORD", options_.password}});
    }
    std::string Url(const std::string& path) {
        return "rsync://" + options_.user + "@127.0.0.1:" + std::to_string(pair_.Port()) + "/" +
               path;
    }
    // One command through the command module, as the sender sends it: the reply's result (""
    // when none came back) and output.
    std::pair<std::string, std::string> Command(const std::string& lines,
                                                const std::string& request = "") {
        static int n = 0;
        const std::string token = "00000000000000000000000000000" + std::to_string(100 + ++n);
        const std::string dir = r_.Root() + "/client" + std::to_string(n);
        fs::create_directories(dir);
        WriteFile(dir + "/input", "token=\"" + token + "\"\n" + lines);
        const ProgramResult p =
            Rsync({"-r", "--early-input=" + dir + "/input",
                   Url("@s2s-cmd/" + (request.empty() ? token + "/" : request)), dir + "/reply/"});
        if (!request.empty()) {  // the module's root or a pattern: nothing comes back
            EXPECT_NE(p.status, 0) << request;
            EXPECT_TRUE(!fs::exists(dir + "/reply") || fs::is_empty(dir + "/reply")) << request;
        }
        return {ReadFile(dir + "/reply/result"), ReadFile(dir + "/reply/output")};
    }
    s2s_test::PairOptions options_;
    s2s_test::ServerPair pair_;
    s2s_test::Host& r_;
};

TEST_F(Receiver, ConfigureWritesModulesAndAPrivateSecret) {
    r_.AddShare("photos");
    r_.AddShare("vault", encrypted);
    r_.AddShare("global");
    const std::string conf = r_.Root() + "/usr/vurn/etc/s2s_rsyncd.conf";
    const std::string secrets = r_.Root() + "/usr/vurn/etc/s2s_rsyncd.secrets";
    const std::vector<std::string> configure = {"configure", "--user", "s2suser", "--port",
                                                std::to_string(pair_.Port())};
    ASSERT_EQ(Tool(configure, "pw with spaces:and:colons\n").status, 0);
    const std::string text = ReadFile(conf);
    // Shares are pushed into, never read back, and drop setuid and setgid bits; keys arrive
    // private, through a hook that checks the destination; connections are limited.
    for (const std::string& needle : std::vector<std::string>{
             "[@s2s-cmd]",
             "[photos]\n\tpath = " + r_.SharePath("photos") +
                 "\n\twrite only = yes\n\tincoming chmod = Dug-s,Fug-s\n",
             "[@vault@]\n\tpath = " + r_.EncryptedPath("vault"),
             "[@s2s-key]",
             "\twrite only = yes\n\tincoming chmod = D700,F600\n\tpre-xfer exec = ",
             "hook-key\n",
             "use chroot = yes",
             "max connections = 16\n",
             "pid file = " + r_.Root() + "/var/run/rsyncd.pid",
             "port = " + std::to_string(pair_.Port()),
         }) {
        EXPECT_NE(text.find(needle), std::string::npos) << needle << "\n" << text;
    }
    EXPECT_EQ(text.find("[global]"), std::string::npos) << "a share named global is served";
    EXPECT_EQ(text.find("pw with"), std::string::npos);
    EXPECT_EQ(ReadFile(secrets), "s2suser:pw with spaces:and:colons\n");
    EXPECT_EQ(Mode(conf), 0600u);
    EXPECT_EQ(Mode(secrets), 0600u);
    // A password file with CR LF line ends gives the password the sender reads from it.
    ASSERT_EQ(Tool(configure, "pw crlf\r\n").status, 0);
    EXPECT_EQ(ReadFile(secrets), "s2suser:pw crlf\n");
    EXPECT_NE(Tool({"configure", "--user", "bad:user"}, "pw\n").status, 0);
    EXPECT_NE(Tool({"configure", "--user", "u"}, "").status, 0) << "no password";
    EXPECT_NE(Tool({"configure", "--user", "u", "--port", "70000"}, "pw\n").status, 0);
    EXPECT_NE(Tool({"start", "now"}).status, 0);
    EXPECT_EQ(Tool({"--help"}).out.compare(0, 19, "usage: s2s-receiver"), 0);
    // A key folder an earlier version left open is made private again.
    chmod(r_.KeyDir().c_str(), 0755);
    WriteFile(r_.KeyDir() + "/old.key", "k");
    chmod((r_.KeyDir() + "/old.key").c_str(), 0644);
    ASSERT_EQ(Tool(configure, "pw\n").status, 0);
    EXPECT_EQ(Mode(r_.KeyDir()), 0700u);
    EXPECT_EQ(Mode(r_.KeyDir() + "/old.key"), 0600u);
    // Two shares served as one module (a hand-edited registry): refused, the old configuration
    // stays.
    const std::string before = ReadFile(conf);
    WriteFile(r_.Root() + "/etc/s2s/shares.conf", "[docs]\n\tpath=\"" + r_.SharePath("photos") +
                                                      "\"\n[DO CS]\n\tpath=\"" +
                                                      r_.SharePath("vault") + "\"\n");
    const ProgramResult clash = Tool(configure, "pw\n");
    EXPECT_NE(clash.status, 0);
    EXPECT_NE(clash.All().find("'docs' and 'DO CS' would be served as one module"),
              std::string::npos)
        << clash.All();
    EXPECT_EQ(clash.All().find(".cpp("), std::string::npos);
    EXPECT_EQ(ReadFile(conf), before);
}

TEST_F(Receiver, StartStatusStopKeepOneDaemonAndEndItsConnections) {
    r_.AddShare("photos");
    EXPECT_NE(Tool({"start"}).status, 0) << "not configured yet";
    // The port taken: start fails and leaves nothing running.
    {
        const int fd = Socket(true);
        EXPECT_NE(pair_.Start(), "");
        close(fd);
    }
    // Two starts at once: one daemon runs afterwards, and the loser says why.
    ProgramResult starts[2];
    std::vector<std::thread> threads;
    for (auto& s : starts) {
        threads.emplace_back([&] { s = Tool({"start"}); });
    }
    for (auto& t : threads) {
        t.join();
    }
    EXPECT_EQ(starts[0].status + starts[1].status, 1) << starts[0].All() << starts[1].All();
    EXPECT_NE((starts[0].All() + starts[1].All()).find("running already"), std::string::npos);
    // A paired client with a bound share shows in the status.
    EXPECT_EQ(Command("command=\"S2S_PairingMultiSrc\"\nclientID=\"SN1\"\nserverName=\"sender\"\n"
                      "syncShares=\"photos\"\ndryRun=\"no\"\noutfile=\"/x\"\n"),
              std::make_pair(std::string("0\n"), std::string("\n")));
    EXPECT_EQ(Command("command=\"S2S_SyncStart\"\nclientID=\"SN1\"\nvolumeName=\"volume1\"\n"
                      "shareName=\"photos\"\n")
                  .first,
              "0\n");
    ProgramResult status = Tool({"status"});
    EXPECT_EQ(status.status, 0);
    EXPECT_EQ(status.out.find("service: running\ntransfers: none running\npairing: multi-client\n"
                              "client: SN1 sender\nshare: photos bound to SN1, last sync started "),
              0u)
        << status.out;
    EXPECT_NE(status.out.find(", not finished\n"), std::string::npos) << status.out;
    // Connections that have been greeted (the daemon forked a process for each) and then stay
    // silent, as a client in the middle of a long transfer: stop ends them with the daemon.
    const std::string pidFile = r_.Root() + "/var/run/rsyncd.pid";
    const pid_t daemon = std::stoi(ReadFile(pidFile));
    std::vector<int> conns;
    for (int i = 0; i < 2; ++i) {
        conns.push_back(Socket(false));
        char greeting[64];
        ASSERT_GT(read(conns.back(), greeting, sizeof greeting), 0);
    }
    std::vector<pid_t> children;
    ASSERT_TRUE(s2s_test::WaitFor([&] {
        children.clear();
        std::ifstream in("/proc/" + std::to_string(daemon) + "/task/" + std::to_string(daemon) +
                         "/children");
        for (pid_t child = 0; in >> child;) {
            children.push_back(child);
        }
        return children.size() == 2;
    }));
    ASSERT_EQ(Tool({"stop"}).status, 0);
    for (pid_t pid : children) {
        const std::string stat = ReadFile("/proc/" + std::to_string(pid) + "/stat");
        const size_t end = stat.rfind(") ");  // gone, or a zombie its new parent has not reaped
        EXPECT_TRUE(end == std::string::npos || stat[end + 2] == 'Z')
            << "connection process " << pid << " outlived the stop";
    }
    for (int fd : conns) {
        char byte;
        EXPECT_EQ(read(fd, &byte, 1), 0) << "the connection was closed";
        close(fd);
    }
    EXPECT_NE(access(pidFile.c_str(), F_OK), 0);
    EXPECT_EQ(Tool({"status"}).out.compare(0, 41, "service: stopped\ntransfers: none running\n"),
              0);
    EXPECT_EQ(Tool({"stop"}).status, 0) << "stopping a stopped daemon is fine";
    // A pairing store that cannot be read: start refuses and leaves nothing running, status
    // still tells what runs, and stop stops.
    const std::string store = r_.Root() + "/usr/vurn/etc/vurnS2S.info";
    const std::string good = ReadFile(store);
    WriteFile(store, "this is no section file\n");
    const ProgramResult refused = Tool({"start"});
    EXPECT_NE(refused.status, 0);
    EXPECT_NE(refused.All().find("cannot be written"), std::string::npos) << refused.All();
    EXPECT_EQ(Tool({"status"}).out.compare(0, 17, "service: stopped\n"), 0);
    WriteFile(store, good);
    ASSERT_EQ(Tool({"start"}).status, 0);
    WriteFile(store, "this is no section file\n");
    status = Tool({"status"});
    EXPECT_NE(status.status, 0);
    EXPECT_EQ(status.out.compare(0, 17, "service: running\n"), 0) << status.out;
    EXPECT_NE(status.All().find("cannot be read"), std::string::npos) << status.All();
    const ProgramResult stopped = Tool({"stop"});
    EXPECT_EQ(stopped.status, 0) << stopped.All();
    EXPECT_NE(stopped.All().find("the daemon is stopped"), std::string::npos) << stopped.All();
    EXPECT_NE(access(pidFile.c_str(), F_OK), 0);
}

// What a client can do through the daemon: read its own command reply by its token only, push
// into the shares the registry has now (also one registered after start), never create device
// files or setuid programs there, never read a share back, and write a key only into an
// encrypted share's key folder, private to root. A transfer in progress shows in the status.
TEST_F(Receiver, TheDaemonTakesOnlyWhatItShould) {
    r_.AddShare("photos");
    r_.AddShare("vault", encrypted);
    ASSERT_EQ(pair_.Start(), "");
    const std::string secret = "0badc0de0badc0de0badc0de0badc0de";
    fs::create_directories(r_.Spool() + "/replies/" + secret);
    WriteFile(r_.Spool() + "/replies/" + secret + "/output", "conflicts\n");
    chmod((r_.Spool() + "/replies/" + secret + "/output").c_str(), 0644);
    const std::string version = "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\noutfile=\"/x\"\n";
    Command(version, "*");
    Command(version, "/");
    EXPECT_EQ(Command(version), std::make_pair(std::string("0\n"), std::string("1\n")));
    // A run pairs before its first dry run or data run: the pairing alone brings the served
    // shares up to date, for a share registered after start as for one removed since.
    const std::string src = r_.Root() + "/src";
    fs::create_directories(src);
    WriteFile(src + "/f", "data");
    r_.AddShare("late");
    {
        s2s_test::ScopedEnv root("S2S_ROOT", r_.Root().c_str());
        ASSERT_EQ(VURNShareRemove("vault"), 0);
    }
    EXPECT_EQ(Command("command=\"S2S_Pairing\"\nclientID=\"SN1\"\ndryRun=\"no\"\n"
                      "serverName=\"sender\"\n")
                  .first,
              "0\n");
    EXPECT_EQ(Rsync({"-r", src + "/", Url("late/")}).status, 0);
    EXPECT_EQ(ReadFile(r_.SharePath("late") + "/f"), "data");
    EXPECT_EQ(Rsync({"-r", src + "/", Url("vault/")}).status, 5) << "a removed share is served";
    r_.AddShare("vault", encrypted);
    EXPECT_EQ(Command("command=\"S2S_SyncStart\"\nclientID=\"SN1\"\nvolumeName=\"volume1\"\n"
                      "shareName=\"vault\"\n")
                  .first,
              "0\n");
    ASSERT_EQ(mknod((src + "/null").c_str(), S_IFCHR | 0666, makedev(1, 3)), 0);
    WriteFile(src + "/suid", "#!/bin/sh\n");
    chmod((src + "/suid").c_str(), 04755);
    fs::create_directories(src + "/sgid");
    chmod((src + "/sgid").c_str(), 02755);
    EXPECT_EQ(Rsync({"-r", "--perms", "--owner", "--group", "--devices", "--specials", src + "/",
                     Url("photos/")})
                  .status,
              23);
    EXPECT_EQ(access((r_.SharePath("photos") + "/null").c_str(), F_OK), -1) << "a device file";
    EXPECT_EQ(Mode(r_.SharePath("photos") + "/suid"), 0755u);
    EXPECT_EQ(Mode(r_.SharePath("photos") + "/sgid"), 0755u) << "a setgid folder arrived";
    EXPECT_NE(Rsync({"-r", Url("photos/"), r_.Root() + "/back/"}).status, 0) << "read back";
    const std::string key = r_.Root() + "/vault.key";
    WriteFile(key, "secret key");
    chmod(key.c_str(), 0644);
    const ProgramResult wrong = Rsync({"--perms", key, Url("@s2s-key/photos/")});
    EXPECT_NE(wrong.status, 0);
    EXPECT_NE(wrong.All().find("encrypted share"), std::string::npos) << wrong.All();
    EXPECT_NE(Rsync({"--perms", key, Url("@s2s-key/")}).status, 0);
    EXPECT_TRUE(s2s_test::TreeManifest(r_.KeyDir()).empty());
    ASSERT_EQ(Rsync({"--perms", key, Url("@s2s-key/vault/")}).status, 0);
    EXPECT_EQ(Mode(r_.KeyDir() + "/vault/vault.key"), 0600u);
    // A transfer held back by a bandwidth limit is running until it is ended.
    WriteFile(src + "/big", std::string(1 << 20, 'b'));
    {
        s2s_test::Program slow({"/usr/bin/rsync", "-r", "--bwlimit=1", src + "/big", Url("late/")},
                               {{"RSYNC_PASSWORD", options_.password}});
        EXPECT_TRUE(s2s_test::WaitFor([&] {
            return Tool({"status"}).out.find("transfers: 1 running") != std::string::npos;
        }));
    }
    EXPECT_TRUE(s2s_test::WaitFor(
        [&] { return Tool({"status"}).out.find("transfers: none running") != std::string::npos; }));
    // Configured as an old server, the daemon's command hook answers like one.
    ASSERT_EQ(pair_.Start(true), "");
    EXPECT_EQ(Command(version), std::make_pair(std::string("43\n"), std::string()));
}

}  // namespace
