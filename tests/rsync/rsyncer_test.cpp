// The Rsyncer, the sending side's handle on one sync server: the command lines it sends (one
// golden table of the Gen*Cmd builders), its local decisions (no client ID, empty parameters, an
// unsafe temporary folder, the share cache, nothing to send), and against a real receiver from
// ServerPair (its daemon on the standard port in a private network): the version query of a
// current, an old and a stock server, the address loop, pairing conflicts, the 202 retry, the
// rsync options of each kind of run and what a share's data runs send.
#include <sched.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <regex>

#include "gtest/gtest.h"
#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_platform.h"
#include "s2s_rsyncer.h"
#include "support/server_pair.h"
#include "support/tree_manifest.h"

namespace {

using namespace s2s_test;
using Lines = std::list<std::string>;
namespace fs = std::filesystem;

const char kPassword[] = "pw-Server-7f3a";

// The library's log, in a file, for the object's lifetime (the shared LogCapture's interface).
class Log {
  public:
    Log() { S2S::Logger::Initialize(S2S::Logger::File, S2S::Logger::Debug, dir_ / "log", 2); }
    ~Log() { S2S::Logger::Destroy(); }
    std::string Text() const { return ReadFile(dir_ / "log"); }
    bool Contains(const std::string& text) const { return Text().find(text) != std::string::npos; }

  private:
    TempDir dir_{"s2s-log"};
};

// A sending host only (no daemon): this process's S2S_ROOT is the host's.
class RsyncerLocal : public ::testing::Test {
  protected:
    Host host_{"sender", "SN-ORDER-1"};
    ScopedEnv root_{"S2S_ROOT", host_.Root().c_str()};
};

// Every command's lines, keys in order; builders append to what the caller has. The host name
// sent is the machine's without its first 35 characters (a name of exactly 35 goes whole).
TEST_F(RsyncerLocal, GoldenCommandLines) {
    if (geteuid() != 0 || unshare(CLONE_NEWUTS) != 0) {
        GTEST_SKIP() << "a host name of our own needs root (UTS namespace)";
    }
    const std::string head(35, 'h');
    ASSERT_EQ(sethostname((head + "tail5").c_str(), 40), 0);
    host_.AddShare("secret", ShareAttrs{true, true, false, true, 32});  // Windows share: ACL
    host_.AddShare("plain");
    const std::string vol = "volumeName=\"" + host_.Volume().substr(1) + "\"";
    S2S::Rsyncer r;
    const struct Row {
        std::function<int(Lines&)> gen;
        Lines lines;
    } rows[] = {
        {[&](Lines& l) { return r.GenServerVersionCmd("/tmp/S2S/temp.abc", l); },
         {"command=\"S2S_GetProtocolVer\"", "outfile=\"/tmp/S2S/temp.abc\""}},
        {[&](Lines& l) { return r.GenSinglePairCmd(true, l); },
         {"command=\"S2S_Pairing\"", "dryRun=\"yes\"", "serverName=\"tail5\""}},
        {[&](Lines& l) { return r.GenSinglePairCmd(false, l); },
         {"command=\"S2S_Pairing\"", "dryRun=\"no\"", "serverName=\"tail5\""}},
        {[&](Lines& l) {
             return r.GenPairMultiSrcCmd(false, {"photos", "docs", "music"}, "/o", l);
         },
         {"command=\"S2S_PairingMultiSrc\"", "serverName=\"tail5\"",
          "syncShares=\"photos:docs:music\"", "dryRun=\"no\"", "outfile=\"/o\""}},
        {[&](Lines& l) { return r.GenFinishSyncCmd("share", "photos", l); },
         {"command=\"S2S_SyncFinish\"", "finishType=\"share\"", "name=\"photos\""}},
        // Values go in verbatim.
        {[&](Lines& l) { return r.GenFinishSyncCmd(" type ", "a\"b", l); },
         {"command=\"S2S_SyncFinish\"", "finishType=\" type \"", "name=\"a\"b\""}},
        {[&](Lines& l) { return r.GenSendBeaconCmd("nightly", l); },
         {"command=\"S2S_UpdateTaskStatus\"", "taskName=\"nightly\""}},
        {[&](Lines& l) { return r.GenStartSyncShareCmd("secret", true, l); },
         {"command=\"S2S_SyncStart\"", vol, "shareName=\"secret\"", "isEncrypt=\"1\"",
          "isAutomount=\"1\"", "isEnableACL=\"1\"", "isWinShare=\"1\"", "lenEncKey=\"32\""}},
        {[&](Lines& l) { return r.GenStartSyncShareCmd("plain", true, l); },
         {"command=\"S2S_SyncStart\"", vol, "shareName=\"plain\"", "isEncrypt=\"0\"",
          "isAutomount=\"0\"", "isEnableACL=\"0\"", "isWinShare=\"0\"", "lenEncKey=\"0\""}},
        {[&](Lines& l) { return r.GenStartSyncShareCmd("secret", false, l); },
         {"command=\"S2S_SyncStart\"", vol, "shareName=\"secret\""}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.lines.front());
        Lines expected = row.lines;
        expected.insert(std::next(expected.begin()), "clientID=\"SN-ORDER-1\"");
        expected.push_front("mine");
        Lines lines = {"mine"};
        EXPECT_EQ(row.gen(lines), 0);
        EXPECT_EQ(lines, expected);
    }
    ASSERT_EQ(sethostname(head.c_str(), head.size()), 0);
    Lines lines;
    ASSERT_EQ(r.GenSinglePairCmd(false, lines), 0);
    EXPECT_EQ(lines.back(), "serverName=\"" + head + "\"");
    // The serial query gives blanks and quotes as '-' (servers take no other client ID).
    host_.WriteHostConf("SN \"quoted\"");
    lines.clear();
    ASSERT_EQ(r.GenSendBeaconCmd("t", lines), 0);
    EXPECT_EQ(*std::next(lines.begin()), "clientID=\"SN--quoted-\"");
}

// What fails before any rsync run, with the log line that says so; the result is left alone.
TEST_F(RsyncerLocal, LocalFailuresStopBeforeAnyRun) {
    host_.AddShare("plain");
    host_.AddShare("nokey", ShareAttrs{true});
    Log log;
    S2S::Rsyncer r;
    Lines lines;
    Lines conflicts;
    int result = 77;
    const struct Row {
        std::function<int()> call;
        int expected;
        std::string logged;  // after "[ERROR] s2s_rsyncer.cpp(<line>): "
    } rows[] = {
        {[&] { return r.GenFinishSyncCmd("", "name", lines); }, -1,
         "GenFinishSyncCmd: Empty parameter"},
        {[&] { return r.GenSendBeaconCmd("", lines); }, -1, "GenSendBeaconCmd: Empty parameter"},
        {[&] { return r.GenPairMultiSrcCmd(true, {}, "/o", lines); }, -1,
         "GenPairMultiSrcCmd: Empty parameter"},
        {[&] { return r.GenStartSyncShareCmd("", true, lines); }, -1,
         "GenStartSyncShareCmd: Empty parameter"},
        {[&] { return r.GenStartSyncShareCmd("missing", true, lines); }, -1,
         "Fail to get share info"},
        {[&] { return r.DoMultiPairing(true, {}, conflicts, result); }, -1,
         "MultiPairing: Share list is empty"},
        {[&] { return r.FinishSync("", "x", result); }, -1,
         "FinishSync: Fail to write command file"},
        {[&] { return r.SendBeacon("", result); }, -1, "SendBeacon: Fail to write command file"},
        {[&] { return r.RunSync(1, "nosuchshare", "/", {}, result); }, -1,
         "Fail to get share info"},
        // A path gone from the share counts as done without rsync.
        {[&] {
             const int rc = r.RunSync(1, "plain", "/gone/file", {}, result) * 1000 + result;
             result = 77;
             return rc;
         },
         0, ""},
        // A plain share has no key; an encrypted one whose key is not stored here sends nothing.
        {[&] { return r.SyncEncryptKey("plain") + r.SyncEncryptKey("nokey"); }, 0, ""},
        {[&] { return r.SyncEncryptKey("missing"); }, S2S::kRsyncResultLocalFailure,
         "Fail to get share 'missing', errno=[" + std::to_string(VLIB_ERR_NOT_FOUND) + "]"},
        // A temporary folder other users could write is refused: no output file, no command.
        {[&] {
             chmod((host_.Root() + "/tmp/S2S").c_str(), 0733);
             return r.DoMultiPairing(true, {"a"}, conflicts, result);
         },
         -1, "MultiPairing: Fail to get output file"},
        {[&] { return r.GetServerVersion(), r.GetServerVersionValue(); }, -1,
         "GetServerVersion: Fail to get output file"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.logged);
        result = 77;
        EXPECT_EQ(row.call(), row.expected);
        EXPECT_EQ(result, 77);
        EXPECT_TRUE(row.logged.empty() || log.Contains("): " + row.logged + "\n")) << log.Text();
    }
    EXPECT_TRUE(lines.empty());
    EXPECT_FALSE(log.Contains("rsync_wrapper.cpp")) << "rsync ran";
    EXPECT_TRUE(log.Contains("[ERROR] s2s_rsyncer.cpp("));
    // No usable address: 42.
    S2S::SyncInfo nowhere;
    nowhere.SetUser("u");
    EXPECT_EQ(r.Initialize(nowhere), S2S::kRsyncResultNoAddress);
    EXPECT_TRUE(log.Contains("): Fail to lookup ip for ()\n"));
    EXPECT_EQ(r.GetServerVersionValue(), -1);
}

// Without a client ID nothing can be sent: each operation stops before any rsync run with its own
// log line; the version query keeps its one reserved output file and the version unknown.
TEST_F(RsyncerLocal, NoClientIdMeansNoCommand) {
    // Without a serial number the client ID is an interface's MAC address; a private network
    // namespace has none.
    if (!EnterPrivateNetwork()) {
        GTEST_SKIP() << "a machine without client ID needs a private network namespace (root)";
    }
    host_.WriteHostConf("");
    ASSERT_EQ(S2S::GetClientID(), "");
    host_.AddShare("photos");
    Log log;
    S2S::Rsyncer r;
    Lines lines;
    Lines conflicts{"keep"};
    int result = 99;
    const struct Row {
        std::function<int()> call;
        const char* logged;
    } rows[] = {
        {[&] { return r.GenSinglePairCmd(true, lines); }, "Fail to get client id"},
        {[&] { return r.GenServerVersionCmd("/o", lines); }, "Fail to get client id"},
        {[&] { return r.GenStartSyncShareCmd("photos", true, lines); }, "Fail to get client id"},
        {[&] { return r.DoSinglePairing(false, result); },
         "SinglePairing: Fail to write command file"},
        {[&] { return r.DoMultiPairing(false, {"photos"}, conflicts, result); },
         "MultiPairing: Fail to write command file"},
        {[&] { return r.FinishSync("share", "photos", result); },
         "FinishSync: Fail to write command file"},
        {[&] { return r.SendBeacon("task", result); }, "SendBeacon: Fail to write command file"},
        {[&] { return r.StartSyncShare("photos", true, result); },
         "StartSyncShare: Fail to write command file"},
        {[&] { return r.StartSyncShare("photos", result); },
         "Fail to start sync share 'photos' with ACL"},
        {[&] { return r.TestProtocol(result); }, "Fail to test connection"},
        {[&] { return r.GetServerVersion(), r.GetServerVersionValue(); },
         "GetServerVersion: Fail to write command file"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.logged);
        EXPECT_EQ(row.call(), -1);
        EXPECT_TRUE(log.Contains(std::string("): ") + row.logged + "\n")) << log.Text();
    }
    EXPECT_TRUE(lines.empty());
    EXPECT_EQ(result, 99);
    EXPECT_EQ(conflicts, (Lines{"keep"}));
    EXPECT_FALSE(log.Contains("rsync_wrapper.cpp")) << "rsync ran";
    fs::directory_iterator left(host_.Root() + "/tmp/S2S");
    EXPECT_EQ(left->path().filename().string().rfind("temp.", 0), 0u);
    EXPECT_EQ(++left, fs::directory_iterator()) << "more than the one reserved file";
}

// Share facts are read once per Rsyncer (re-initialising keeps them): a later change on disk is
// not seen, a failed lookup caches nothing, a fresh Rsyncer reads anew.
TEST_F(RsyncerLocal, ShareFactsAreReadOncePerRsyncer) {
    host_.AddShare("photos");
    S2S::Rsyncer r;
    S2S::ShareInfo info;
    EXPECT_EQ(r.GetShareInfo("late", info), -1);
    ASSERT_EQ(r.GetShareInfo("photos", info), 0);
    host_.AddShare("photos", ShareAttrs{true});
    host_.AddShare("late");
    r.Initialize(S2S::SyncInfo());
    ASSERT_EQ(r.GetShareInfo("photos", info), 0);
    EXPECT_FALSE(info.IsEncrypted());
    EXPECT_EQ(info.GetModuleName(), "photos");
    EXPECT_EQ(r.GetShareInfo("late", info), 0);
    S2S::Rsyncer fresh;
    ASSERT_EQ(fresh.GetShareInfo("photos", info), 0);
    EXPECT_TRUE(info.IsEncrypted());
    EXPECT_EQ(info.GetModuleName(), "@photos@");
}

class RsyncerServer : public ::testing::Test {
  protected:
    const PairOptions options_{"s2suser", kPassword, /*standardPort=*/true};
    void SetUp() override {
        if (const std::string why = ServerPair::Unavailable(options_); !why.empty()) {
            GTEST_SKIP() << why;
        }
        pair_ = std::make_unique<ServerPair>(options_);
        root_ = std::make_unique<ScopedEnv>("S2S_ROOT", pair_->Sender().Root().c_str());
        for (Host* host : {&pair_->Sender(), &pair_->Receiver()}) {
            for (const char* share : {"photos", "docs", "music"}) {
                host->AddShare(share);
            }
            host->AddShare("secret", ShareAttrs{true, false, false, false, 32});
        }
    }
    // Nothing of a command may stay behind: neither the output files here nor the server's
    // replies (removed after the client has its answer, hence the wait).
    void ExpectNoLeftovers() {
        EXPECT_TRUE(fs::is_empty(pair_->Sender().Root() + "/tmp/S2S"));
        EXPECT_TRUE(WaitFor([&] { return fs::is_empty(pair_->Receiver().Spool() + "/replies"); }));
    }
    std::string Status() { return pair_->Receiver().Run("s2s-receiver", {"status"}).out; }
    std::unique_ptr<ServerPair> pair_;
    std::unique_ptr<ScopedEnv> root_;
};

// The address loop walks the given IP, then the name's addresses; the first that answers both
// the connection test and the version query wins and stays in the SyncInfo. Connect, unlike
// Initialize, fails when the version cannot be read (an unknown version would pass for an old
// server and skip the conflict check). A server that is down leaves the last code and address.
TEST_F(RsyncerServer, AddressLoopVersionQueryAndServerDown) {
    ASSERT_EQ(pair_->Start(), "");
    Log log;
    S2S::SyncInfo info = pair_->Info();
    info.SetServerIP("127.0.0.2");  // nothing listens there
    info.SetServerName("localhost");
    S2S::Rsyncer r;
    EXPECT_EQ(r.Initialize(info), 0);
    EXPECT_EQ(r.GetSyncInfo().GetServerIP(), "127.0.0.1");
    EXPECT_TRUE(r.SupportMultiSource());
    // In this order: the first address tried and failed, the second tried.
    EXPECT_TRUE(
        std::regex_search(log.Text(), std::regex("Test 127.0.0.2 is reachable\n[^]*Fail to test "
                                                 "connection \\[10\\]\n[^]*Test 127.0.0.1 is")))
        << log.Text();
    EXPECT_TRUE(log.Contains("[INFO] s2s_rsyncer.cpp("));
    EXPECT_TRUE(log.Contains("): Get server version [1]\n"));
    ExpectNoLeftovers();
    const std::string temp = pair_->Sender().Root() + "/tmp/S2S";
    ASSERT_EQ(chmod(temp.c_str(), 0777), 0);  // refused: others could write there
    S2S::Rsyncer kept;
    EXPECT_EQ(kept.Initialize(pair_->Info()), 0);
    EXPECT_EQ(kept.GetServerVersionValue(), -1);
    S2S::Rsyncer connect;
    EXPECT_EQ(connect.Connect(pair_->Info()), S2S::kRsyncResultNoVersion);
    EXPECT_EQ(connect.GetServerVersionResult(), 11);
    EXPECT_NE(connect.GetLastError().find("has mode 0777"), std::string::npos);
    ASSERT_EQ(chmod(temp.c_str(), 0700), 0);
    EXPECT_EQ(connect.Connect(pair_->Info()), 0);
    EXPECT_EQ(connect.GetServerVersionResult(), 0);
    pair_->Stop();
    r.GetServerVersion();
    EXPECT_TRUE(log.Contains("): Fail to get server version [10]\n"));
    EXPECT_EQ(r.GetServerVersionValue(), 1) << "a failed query forgot the known version";
    S2S::Rsyncer down;
    EXPECT_EQ(down.Initialize(info), 10);
    EXPECT_EQ(down.GetSyncInfo().GetServerIP(), "127.0.0.1");
    EXPECT_TRUE(log.Contains("): Fail to find rsync reachable ip for localhost(127.0.0.1)\n"));
    int result = -1;
    EXPECT_EQ(down.SendBeacon("nightly", result), 0);
    EXPECT_EQ(result, 10);
    EXPECT_EQ(r.Initialize(info), 0) << "a version learnt before no longer counts";
    EXPECT_FALSE(log.Contains(kPassword));
}

// A stock rsync daemon has no command module: the connection test fails with 51, which the
// version query takes for an old server. An old server is version 0: it pairs the client as a
// whole (no conflicts), refuses a second client with 207 (which a dry run still takes as a
// working connection) and share attributes with 202 (sent again without them).
TEST_F(RsyncerServer, StockAndOldServers) {
    {
        TempDir dir("s2s-stock");
        WriteFile(dir / "rsyncd.conf",
                  "port = 873\naddress = 127.0.0.1\nuse chroot = no\n"
                  "[data]\n\tpath = " +
                      dir.path() + "\n");
        Program stock(
            {"/usr/bin/rsync", "--daemon", "--no-detach", "--config=" + (dir / "rsyncd.conf")});
        Log log;
        S2S::Rsyncer r;
        int rc = -1;
        ASSERT_TRUE(WaitFor([&] { return (rc = r.Initialize(pair_->Info())) != 10; }));
        EXPECT_EQ(rc, S2S::kRsyncResultUnknownCmdAlt);
        EXPECT_TRUE(log.Contains("): Fail to test connection [51]\n"));
        r.GetServerVersion();
        EXPECT_EQ(r.GetServerVersionValue(), 0);
        EXPECT_FALSE(log.Contains("Fail to get server version"));
    }
    ASSERT_EQ(pair_->Start(/*oldServer=*/true), "");
    S2S::Rsyncer r;
    EXPECT_EQ(r.Initialize(pair_->Info()), 0);
    EXPECT_EQ(r.GetServerVersionValue(), 0);
    Lines conflicts{"stale"};
    int result = -1;
    EXPECT_EQ(r.DoPairing(false, {"photos", "docs"}, conflicts, result), 0);
    EXPECT_EQ(result, 0);
    EXPECT_TRUE(conflicts.empty());
    EXPECT_NE(Status().find("SN-SENDER-0001"), std::string::npos);
    EXPECT_EQ(r.StartSyncShare("photos", true, result), 0);
    EXPECT_EQ(result, S2S::kRsyncResultRetryPlain);
    EXPECT_EQ(r.StartSyncShare("photos", false, result), 0);
    EXPECT_EQ(result, 0);
    result = -1;
    EXPECT_EQ(r.StartSyncShare("photos", result), 0);
    EXPECT_EQ(result, 0);
    pair_->Sender().WriteHostConf("SN-CLIENT-B");
    S2S::Rsyncer other;
    EXPECT_EQ(other.Initialize(pair_->Info()), 0);
    EXPECT_EQ(other.DoSinglePairing(false, result), 0);
    EXPECT_EQ(result, 207);
    EXPECT_EQ(other.TestProtocol(result), 0);
    EXPECT_EQ(result, 0);
    ExpectNoLeftovers();
}

// A share is bound to the client that completed a sync into it: a second client learns which of
// its shares conflict (214, appended to its list); the server's other refusals come back
// unchanged and are not retried.
TEST_F(RsyncerServer, MultiSourcePairingReportsConflictingShares) {
    ASSERT_EQ(pair_->Start(), "");
    Log log;
    int result = -1;
    Lines conflicts;
    {
        S2S::Rsyncer first;
        ASSERT_EQ(first.Initialize(pair_->Info()), 0);
        EXPECT_EQ(first.StartSyncShare("photos", result), 0);
        EXPECT_EQ(result, 208) << "not paired yet";
        EXPECT_EQ(first.FinishSync("complete", "photos", result), 0);
        EXPECT_EQ(result, 208);
        EXPECT_EQ(first.DoPairing(false, {"photos", "docs"}, conflicts, result), 0);
        EXPECT_EQ(result, 0);
        for (const char* share : {"photos", "docs"}) {
            EXPECT_EQ(first.StartSyncShare(share, result), 0);
            EXPECT_EQ(result, 0);
            EXPECT_EQ(first.FinishSync("complete", share, result), 0);
            EXPECT_EQ(result, 0);
        }
    }
    pair_->Sender().WriteHostConf("SN-CLIENT-B");
    S2S::Rsyncer second;
    ASSERT_EQ(second.Initialize(pair_->Info()), 0);
    conflicts = {"kept"};
    EXPECT_EQ(second.DoPairing(true, {"music", "photos", "docs"}, conflicts, result), 0);
    EXPECT_EQ(result, S2S::kRsyncResultConflict);
    EXPECT_EQ(conflicts, (Lines{"kept", "photos", "docs"}));
    conflicts.clear();
    EXPECT_EQ(second.DoMultiPairing(false, {"music"}, conflicts, result), 0);
    EXPECT_EQ(result, 0);
    EXPECT_TRUE(conflicts.empty());
    EXPECT_EQ(second.DoMultiPairing(false, {"bad/name"}, conflicts, result), -1);
    EXPECT_EQ(result, 204);
    EXPECT_TRUE(log.Contains("): Fail to check share pairing [204]\n"));
    ExpectNoLeftovers();
}

// What each kind of run hands to rsync (an "rsync" first on PATH records its arguments) and what
// it sends: commands with 60 s, transfers with 600 s; the debug log for real tasks only; the
// task's compression, block-level sync and bandwidth limit on data runs; the whole share with its
// exclude rules, one path inside it recreated in the same place, an encrypted share as its
// ciphertext folder into its "@name@" module; the daemon port without SSH, the task's SSH port
// with it; a cancelled run.
TEST_F(RsyncerServer, RunsCarryTheTasksOptionsAndSendTheShare) {
    ASSERT_EQ(pair_->Start(), "");
    TempDir shim("s2s-shim");
    const std::string log = shim / "argv";
    WriteFile(shim / "rsync", "#!/bin/sh\nfor a in \"$@\"; do printf '%s ' \"$a\"; done >>'" + log +
                                  "'\necho >>'" + log + "'\nexec /usr/bin/rsync \"$@\"\n");
    chmod((shim / "rsync").c_str(), 0755);
    ScopedEnv path("PATH", (shim.path() + ":" + std::getenv("PATH")).c_str());
    const std::string src = pair_->Sender().SharePath("photos");
    const std::string dst = pair_->Receiver().SharePath("photos");
    fs::create_directories(src + "/album");
    WriteFile(src + "/album/a.txt", "first\n");
    WriteFile(src + "/readme", "hello");
    WriteFile(src + "/scratch.tmp", "never sent");
    WriteFile(dst + "/stray", "removed");
    const std::string lower = pair_->Sender().EncryptedPath("secret");
    WriteFile(lower + "/ECRYPTFS_FNEK_ENCRYPTED.aaaa", "cipher");
    WriteFile(pair_->Sender().SharePath("secret") + "/plain.txt", "cleartext never leaves");
    S2S::SyncInfo info = pair_->Info();
    info.SetSSHPort(2222);  // not used: the task does not use SSH
    info.SetCompression(true);
    info.SetMaxBandwidth(300);
    S2S::SyncInfo delta = pair_->Info();
    delta.SetBlockLevelSync(true);
    S2S::SyncInfo ssh = info;
    ssh.SetSSH(true);
    S2S::Rsyncer r;
    int result = -1;
    Lines conflicts;
    const std::string url = "rsync://s2suser@127.0.0.1/";
    const struct Row {
        const char* name;
        std::function<void()> run;
        std::vector<std::string> with, without;
    } rows[] = {
        {"initialize: dry-run pairing and version query",
         [&] { ASSERT_EQ(r.Initialize(info), 0); },
         {"--timeout=60", url + "@s2s-cmd/"},
         {"--rsh", "--log-file", "--bwlimit", "--compress", "127.0.0.1:"}},
        {"whole share",
         [&] {
             ASSERT_EQ(r.DoPairing(false, {"photos", "secret"}, conflicts, result), 0);
             ASSERT_EQ(r.StartSyncShare("photos", result), 0);
             ASSERT_EQ(r.RunSync(1, "photos", "/", {"*.tmp", "cache/"}, result), 0);
             ASSERT_EQ(result, 0);
             auto expected = TreeManifest(src);
             expected.erase("/scratch.tmp");
             EXPECT_EQ(TreeManifest(dst), expected);
         },
         {"--timeout=600", "--delete", "--numeric-ids", "--compress", "--whole-file", "--acls",
          "--exclude=*.tmp", "--exclude=cache/", "--bwlimit=300",
          "--log-file=" + pair_->Sender().Root() + "/var/log/s2s_rsync.log",
          " -- " + src + "/ " + url + "photos \n"},
         {"--relative", "--rsh"}},
        {"one path, block-level",
         [&] {
             fs::create_directories(src + "/inbox/deep");
             WriteFile(src + "/inbox/deep/one.txt", "one\n");
             WriteFile(src + "/readme", "changed but not sent");
             S2S::Rsyncer other;
             ASSERT_EQ(other.Initialize(delta), 0);
             ASSERT_EQ(other.RunSync(2, "photos", "/inbox/deep/one.txt", {}, result), 0);
             ASSERT_EQ(result, 0);
             EXPECT_EQ(ReadFile(dst + "/inbox/deep/one.txt"), "one\n");
             EXPECT_EQ(ReadFile(dst + "/readme"), "hello");
         },
         {"--relative", "--no-whole-file",
          " -- " + src + "/./inbox/deep/one.txt " + url + "photos \n"},
         {"--bwlimit", "--compress"}},
        {"encrypted share",
         [&] {
             ASSERT_EQ(r.RunSync(3, "secret", "/", {}, result), 0);
             ASSERT_EQ(result, 0);
             EXPECT_EQ(TreeManifest(pair_->Receiver().EncryptedPath("secret")),
                       TreeManifest(lower));
             EXPECT_TRUE(fs::is_empty(pair_->Receiver().SharePath("secret")));
         },
         {" -- " + lower + "/ " + url + "@secret@ \n"},
         {}},
        {"test task",
         [&] {
             S2S::Rsyncer::RsyncTask quiet;
             ASSERT_EQ(r.InitRsyncTask(quiet, true), 0);
             EXPECT_EQ(quiet.Execute(src + "/", "photos", nullptr, "", {}), 0);
         },
         {"--timeout=600"},
         {"--log-file"}},
        {"command over ssh",
         [&] {
             S2S::Rsyncer overSsh;
             overSsh.Initialize(ssh);  // no sshd on that port: only the arguments matter
             S2S::Rsyncer::RsyncTask task;
             ASSERT_EQ(overSsh.InitRsyncTask(task, false), 0);
             unlink(log.c_str());
             EXPECT_NE(
                 task.ExecuteCmd({"command=\"S2S_UpdateTaskStatus\"", "clientID=\"x\""}, nullptr),
                 0);
         },
         {"--rsh=sshpass -e ssh -p 2222 ", "--timeout=60"},
         {"--log-file"}},
        {"cancelled",
         [&] {
             r.SetCancelChecker([] { return true; });
             ASSERT_EQ(r.RunSync(4, "photos", "/", {}, result), 0);
             EXPECT_EQ(result, VURN::Backup::RsyncWrapper::kResultCancelled);
         },
         {},
         {}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        unlink(log.c_str());
        row.run();
        const std::string argv = ReadFile(log);
        for (const std::string& arg : row.with) {
            EXPECT_NE(argv.find(arg), std::string::npos) << arg << " missing in " << argv;
        }
        for (const std::string& arg : row.without) {
            EXPECT_EQ(argv.find(arg), std::string::npos) << arg << " present in " << argv;
        }
        EXPECT_EQ(argv.find(kPassword), std::string::npos);
    }
    r.SetCancelChecker(nullptr);
    EXPECT_EQ(r.FinishSync("complete", "photos", result), 0);
    EXPECT_EQ(result, 0);
    EXPECT_NE(Status().find(", last sync completed"), std::string::npos) << Status();
    ExpectNoLeftovers();
}

}  // namespace
