// Command files and local decisions of the Rsyncer that need no server: the exact lines and key
// order of every command, the "yes"/"no" and "1"/"0" encodings, the host name sent, the builder
// preconditions, the share-info cache and the local failure paths with their log lines.
#include <sched.h>
#include <unistd.h>

#include <filesystem>
#include <list>
#include <string>
#include <type_traits>
#include <vector>

#include "gtest/gtest.h"
#include "rsync/rsyncer_fixture.h"
#include "s2s_host.h"
#include "s2s_rsyncer.h"

namespace {

using rsyncer_test::ClientHost;
using rsyncer_test::LogCapture;
using rsyncer_test::ShareAttrs;
using Lines = std::list<std::string>;

// Programs built against the published interface link against these two as non-const members.
static_assert(std::is_same<decltype(&S2S::Rsyncer::GenServerVersionCmd),
                           int (S2S::Rsyncer::*)(const std::string&, Lines&)>::value);
static_assert(std::is_same<decltype(&S2S::Rsyncer::GenSinglePairCmd),
                           int (S2S::Rsyncer::*)(bool, Lines&)>::value);

std::string Host35() {
    return S2S::GetHostName(35);
}

TEST(RsyncerStrings, SplitKeepsEmptyPiecesAndJoinIsItsInverse) {
    Lines out;
    S2S::SplitStringByChars("a::b", ":", out);
    EXPECT_EQ(out, (Lines{"a", "", "b"}));

    out.clear();
    S2S::SplitStringByChars("", ":", out);
    EXPECT_EQ(out, (Lines{""}));

    // Any of the separator characters splits; the list is appended to, not replaced.
    out = {"x"};
    S2S::SplitStringByChars("a,b;c:", ",;", out);
    EXPECT_EQ(out, (Lines{"x", "a", "b", "c:"}));

    EXPECT_EQ(S2S::JoinItems({}, ":"), "");
    EXPECT_EQ(S2S::JoinItems({"one"}, ":"), "one");
    EXPECT_EQ(S2S::JoinItems({"a", "", "b"}, ":"), "a::b");
    Lines back;
    S2S::SplitStringByChars(S2S::JoinItems({"a", "", "b"}, ":"), ":", back);
    EXPECT_EQ(back, (Lines{"a", "", "b"}));
}

TEST(RsyncerCommandFile, EveryCommandHasItsKeysInOrder) {
    ClientHost host("SN-ORDER-1");
    S2S::Rsyncer rsyncer;
    const std::string name = Host35();
    ASSERT_FALSE(name.empty());

    Lines lines;
    ASSERT_EQ(rsyncer.GenServerVersionCmd("/tmp/S2S/temp.abc", lines), 0);
    EXPECT_EQ(lines, (Lines{"command=\"S2S_GetProtocolVer\"", "clientID=\"SN-ORDER-1\"",
                            "outfile=\"/tmp/S2S/temp.abc\""}));

    lines.clear();
    ASSERT_EQ(rsyncer.GenSinglePairCmd(true, lines), 0);
    EXPECT_EQ(lines, (Lines{"command=\"S2S_Pairing\"", "clientID=\"SN-ORDER-1\"", "dryRun=\"yes\"",
                            "serverName=\"" + name + "\""}));
    lines.clear();
    ASSERT_EQ(rsyncer.GenSinglePairCmd(false, lines), 0);
    EXPECT_EQ(lines.back(), "serverName=\"" + name + "\"");
    EXPECT_EQ(*std::next(lines.begin(), 2), "dryRun=\"no\"");

    lines.clear();
    ASSERT_EQ(rsyncer.GenPairMultiSrcCmd(false, {"photos", "docs", "music"}, "/o", lines), 0);
    EXPECT_EQ(lines, (Lines{"command=\"S2S_PairingMultiSrc\"", "clientID=\"SN-ORDER-1\"",
                            "serverName=\"" + name + "\"", "syncShares=\"photos:docs:music\"",
                            "dryRun=\"no\"", "outfile=\"/o\""}));

    lines.clear();
    ASSERT_EQ(rsyncer.GenFinishSyncCmd("share", "photos", lines), 0);
    EXPECT_EQ(lines, (Lines{"command=\"S2S_SyncFinish\"", "clientID=\"SN-ORDER-1\"",
                            "finishType=\"share\"", "name=\"photos\""}));

    lines.clear();
    ASSERT_EQ(rsyncer.GenSendBeaconCmd("nightly", lines), 0);
    EXPECT_EQ(lines, (Lines{"command=\"S2S_UpdateTaskStatus\"", "clientID=\"SN-ORDER-1\"",
                            "taskName=\"nightly\""}));

    // Builders append: a caller may prefix lines of its own.
    lines = {"first"};
    ASSERT_EQ(rsyncer.GenSendBeaconCmd("t", lines), 0);
    EXPECT_EQ(lines.size(), 4u);
    EXPECT_EQ(lines.front(), "first");
}

// The serial query gives blanks and quotes as '-' (servers take no other client ID); the
// builder itself inserts every value as it is.
TEST(RsyncerCommandFile, ValuesGoInVerbatim) {
    ClientHost host("SN \"quoted\"");
    S2S::Rsyncer rsyncer;
    Lines lines;
    ASSERT_EQ(rsyncer.GenFinishSyncCmd(" type ", "a\"b", lines), 0);
    EXPECT_EQ(lines, (Lines{"command=\"S2S_SyncFinish\"", "clientID=\"SN--quoted-\"",
                            "finishType=\" type \"", "name=\"a\"b\""}));
}

TEST(RsyncerCommandFile, StartSyncShareCarriesAttributesAsOneAndZero) {
    ClientHost host("SN-START");
    ShareAttrs attrs;
    attrs.encrypted = true;
    attrs.autoMount = true;
    attrs.winShare = true;  // a Windows share counts as an ACL share
    attrs.keyLen = 32;
    host.AddShare("secret", attrs);
    host.AddShare("plain");
    S2S::Rsyncer rsyncer;
    const std::string volume = host.Volume().substr(1);

    Lines lines;
    ASSERT_EQ(rsyncer.GenStartSyncShareCmd("secret", true, lines), 0);
    EXPECT_EQ(lines, (Lines{"command=\"S2S_SyncStart\"", "clientID=\"SN-START\"",
                            "volumeName=\"" + volume + "\"", "shareName=\"secret\"",
                            "isEncrypt=\"1\"", "isAutomount=\"1\"", "isEnableACL=\"1\"",
                            "isWinShare=\"1\"", "lenEncKey=\"32\""}));

    lines.clear();
    ASSERT_EQ(rsyncer.GenStartSyncShareCmd("plain", true, lines), 0);
    EXPECT_EQ(lines, (Lines{"command=\"S2S_SyncStart\"", "clientID=\"SN-START\"",
                            "volumeName=\"" + volume + "\"", "shareName=\"plain\"",
                            "isEncrypt=\"0\"", "isAutomount=\"0\"", "isEnableACL=\"0\"",
                            "isWinShare=\"0\"", "lenEncKey=\"0\""}));

    lines.clear();
    ASSERT_EQ(rsyncer.GenStartSyncShareCmd("secret", false, lines), 0);
    EXPECT_EQ(lines, (Lines{"command=\"S2S_SyncStart\"", "clientID=\"SN-START\"",
                            "volumeName=\"" + volume + "\"", "shareName=\"secret\""}));
}

TEST(RsyncerCommandFile, LongHostNameLosesItsFirst35Characters) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "a private host name needs root (UTS namespace)";
    }
    ClientHost host("SN-HOST");
    const std::string head(35, 'h');
    const std::string result = rsyncer_test::RunInChild([&]() -> std::string {
        const std::string longName = head + "tail5";
        if (unshare(CLONE_NEWUTS) != 0 || sethostname(longName.c_str(), longName.size()) != 0) {
            return "<no uts namespace>";
        }
        S2S::Rsyncer rsyncer;
        Lines single;
        Lines multi;
        rsyncer.GenSinglePairCmd(false, single);
        rsyncer.GenPairMultiSrcCmd(true, {"a"}, "/o", multi);
        return single.back() + "|" + *std::next(multi.begin(), 2);
    });
    EXPECT_EQ(result, "serverName=\"tail5\"|serverName=\"tail5\"");

    const std::string exact = rsyncer_test::RunInChild([&]() -> std::string {
        if (unshare(CLONE_NEWUTS) != 0 || sethostname(head.c_str(), head.size()) != 0) {
            return "<no uts namespace>";
        }
        S2S::Rsyncer rsyncer;
        Lines single;
        rsyncer.GenSinglePairCmd(false, single);
        return single.back();
    });
    // A name of exactly 35 characters is sent whole.
    EXPECT_EQ(exact, "serverName=\"" + head + "\"");
}

TEST(RsyncerCommandFile, EmptyParametersAreRefused) {
    ClientHost host;
    LogCapture log;
    S2S::Rsyncer rsyncer;
    Lines lines;
    EXPECT_EQ(rsyncer.GenFinishSyncCmd("", "name", lines), -1);
    EXPECT_EQ(rsyncer.GenFinishSyncCmd("type", "", lines), -1);
    EXPECT_EQ(log.Count("] s2s_rsyncer.cpp("), 2u);
    EXPECT_EQ(log.Count("): GenFinishSyncCmd: Empty parameter\n"), 2u);
    EXPECT_EQ(rsyncer.GenSendBeaconCmd("", lines), -1);
    EXPECT_TRUE(log.Has("[ERROR] s2s_rsyncer.cpp("));
    EXPECT_TRUE(log.Has("): GenSendBeaconCmd: Empty parameter\n"));
    EXPECT_EQ(rsyncer.GenPairMultiSrcCmd(true, {}, "/o", lines), -1);
    EXPECT_TRUE(log.Has("): GenPairMultiSrcCmd: Empty parameter\n"));
    EXPECT_EQ(rsyncer.GenStartSyncShareCmd("", true, lines), -1);
    EXPECT_TRUE(log.Has("): GenStartSyncShareCmd: Empty parameter\n"));
    EXPECT_EQ(rsyncer.GenStartSyncShareCmd("missing", true, lines), -1);
    EXPECT_TRUE(log.Has("): Fail to get share info\n"));
    EXPECT_TRUE(lines.empty());

    int result = 77;
    EXPECT_EQ(rsyncer.DoMultiPairing(true, {}, lines, result), -1);
    EXPECT_TRUE(log.Has("): MultiPairing: Share list is empty\n"));
    EXPECT_EQ(rsyncer.FinishSync("", "x", result), -1);
    EXPECT_TRUE(log.Has("): FinishSync: Fail to write command file\n"));
    EXPECT_EQ(rsyncer.SendBeacon("", result), -1);
    EXPECT_TRUE(log.Has("): SendBeacon: Fail to write command file\n"));
    EXPECT_EQ(result, 77);
}

// Without a client ID nothing can be sent: each operation stops before any rsync run, logs its
// own line and leaves the result untouched.
TEST(RsyncerCommandFile, NoClientIdMeansNoCommand) {
    // Without a serial number the client ID falls back to an interface's MAC address; a private
    // network namespace has none (this test process keeps it, no other test here needs a network).
    if (geteuid() != 0 || unshare(CLONE_NEWNET) != 0) {
        GTEST_SKIP() << "a machine without client ID needs a private network namespace (root)";
    }
    ClientHost host("");
    ASSERT_EQ(S2S::GetClientID(), "");
    host.AddShare("photos");
    LogCapture log;
    S2S::Rsyncer rsyncer;
    Lines lines;
    EXPECT_EQ(rsyncer.GenSinglePairCmd(true, lines), -1);
    EXPECT_EQ(rsyncer.GenServerVersionCmd("/o", lines), -1);
    EXPECT_EQ(rsyncer.GenStartSyncShareCmd("photos", true, lines), -1);
    EXPECT_TRUE(lines.empty());
    EXPECT_EQ(log.Count("[ERROR] s2s_rsyncer.cpp("), 3u);
    EXPECT_EQ(log.Count("): Fail to get client id\n"), 3u);

    int result = 99;
    Lines conflicts{"keep"};
    EXPECT_EQ(rsyncer.DoSinglePairing(false, result), -1);
    EXPECT_TRUE(log.Has("): SinglePairing: Fail to write command file\n"));
    EXPECT_EQ(rsyncer.DoMultiPairing(false, {"photos"}, conflicts, result), -1);
    EXPECT_TRUE(log.Has("): MultiPairing: Fail to write command file\n"));
    EXPECT_EQ(rsyncer.FinishSync("share", "photos", result), -1);
    EXPECT_TRUE(log.Has("): FinishSync: Fail to write command file\n"));
    EXPECT_EQ(rsyncer.SendBeacon("task", result), -1);
    EXPECT_TRUE(log.Has("): SendBeacon: Fail to write command file\n"));
    EXPECT_EQ(rsyncer.StartSyncShare("photos", true, result), -1);
    EXPECT_TRUE(log.Has("): StartSyncShare: Fail to write command file\n"));
    EXPECT_EQ(rsyncer.StartSyncShare("photos", result), -1);
    EXPECT_TRUE(log.Has("): Fail to start sync share 'photos' with ACL\n"));
    EXPECT_EQ(result, 99);
    EXPECT_EQ(conflicts, (Lines{"keep"}));

    // The connection test reports the failure to send as its own.
    EXPECT_EQ(rsyncer.TestProtocol(result), -1);
    EXPECT_TRUE(log.Has("): Fail to test connection\n"));

    // The version query keeps its reserved output file on this path, and the version unknown.
    rsyncer.GetServerVersion();
    EXPECT_TRUE(log.Has("): GetServerVersion: Fail to write command file\n"));
    EXPECT_EQ(rsyncer.GetServerVersionValue(), -1);
    size_t leftovers = 0;
    for (const auto& entry : std::filesystem::directory_iterator(host.TempDir())) {
        EXPECT_EQ(entry.path().filename().string().rfind("temp.", 0), 0u);
        ++leftovers;
    }
    EXPECT_EQ(leftovers, 1u);

    // The multi-source pairing hands its output file back even when the command cannot be built.
    EXPECT_EQ(rsyncer.DoMultiPairing(false, {"photos"}, conflicts, result), -1);
    leftovers = 0;
    for (const auto& entry : std::filesystem::directory_iterator(host.TempDir())) {
        (void)entry;
        ++leftovers;
    }
    EXPECT_EQ(leftovers, 1u);
}

// A temporary directory other users could write is refused: no output file, no command.
TEST(RsyncerCommandFile, UnsafeTemporaryDirectoryStopsOutputCommands) {
    ClientHost host;
    ASSERT_EQ(chmod(host.TempDir().c_str(), 0733), 0);
    LogCapture log;
    S2S::Rsyncer rsyncer;
    rsyncer.GetServerVersion();
    EXPECT_TRUE(log.Has("[ERROR] s2s_rsyncer.cpp("));
    EXPECT_TRUE(log.Has("): GetServerVersion: Fail to get output file\n"));
    EXPECT_EQ(rsyncer.GetServerVersionValue(), -1);
    EXPECT_FALSE(rsyncer.SupportMultiSource());

    Lines conflicts;
    int result = 5;
    EXPECT_EQ(rsyncer.DoMultiPairing(true, {"a"}, conflicts, result), -1);
    EXPECT_TRUE(log.Has("): MultiPairing: Fail to get output file\n"));
    EXPECT_EQ(result, 5);
}

// Share facts are read once per Rsyncer: a later change on disk is not seen, and a failed lookup
// caches nothing.
TEST(RsyncerShareCache, FirstAnswerSticksForTheRsyncersLife) {
    ClientHost host;
    host.AddShare("photos");
    S2S::Rsyncer rsyncer;
    S2S::ShareInfo info;
    EXPECT_EQ(rsyncer.GetShareInfo("late", info), -1);
    ASSERT_EQ(rsyncer.GetShareInfo("photos", info), 0);
    EXPECT_FALSE(info.IsEncrypted());
    EXPECT_EQ(info.GetModuleName(), "photos");

    ShareAttrs encrypted;
    encrypted.encrypted = true;
    host.AddShare("photos", encrypted);
    host.AddShare("late");
    S2S::ShareInfo again;
    ASSERT_EQ(rsyncer.GetShareInfo("photos", again), 0);
    EXPECT_FALSE(again.IsEncrypted());
    EXPECT_EQ(again.GetModuleName(), "photos");
    EXPECT_EQ(rsyncer.GetShareInfo("late", again), 0);

    // Re-initialising keeps the cache (and a server that cannot be looked up gives 42).
    S2S::SyncInfo nowhere;
    nowhere.SetUser("u");
    EXPECT_EQ(rsyncer.Initialize(nowhere), S2S::kRsyncResultNoAddress);
    ASSERT_EQ(rsyncer.GetShareInfo("photos", again), 0);
    EXPECT_FALSE(again.IsEncrypted());

    // A fresh Rsyncer reads the registry anew.
    S2S::Rsyncer fresh;
    ASSERT_EQ(fresh.GetShareInfo("photos", again), 0);
    EXPECT_TRUE(again.IsEncrypted());
    EXPECT_EQ(again.GetModuleName(), "@photos@");
}

TEST(RsyncerShareSync, VanishedPathCountsAsDoneWithoutRsync) {
    ClientHost host;
    host.AddShare("photos");
    LogCapture log;
    S2S::Rsyncer rsyncer;
    S2S::SyncInfo info;
    info.SetServerIP("127.0.0.1");
    info.SetUser("u");
    // Nothing runs: a run would need a server and return a non-zero code.
    int result = 123;
    EXPECT_EQ(rsyncer.RunSync(1, "photos", "/gone/file", {}, result), 0);
    EXPECT_EQ(result, 0);
    EXPECT_FALSE(log.Has("rsync_wrapper.cpp"));

    result = 123;
    EXPECT_EQ(rsyncer.RunSync(1, "nosuchshare", "/", {}, result), -1);
    EXPECT_TRUE(log.Has("[ERROR] s2s_rsyncer.cpp("));
    EXPECT_TRUE(log.Has("): Fail to get share info\n"));
    EXPECT_EQ(result, 123);
}

TEST(RsyncerServerLookup, NoUsableAddressGives42) {
    ClientHost host;
    LogCapture log;
    S2S::Rsyncer rsyncer;
    S2S::SyncInfo info;
    info.SetServerName("");
    info.SetServerIP("");
    info.SetUser("u");
    EXPECT_EQ(rsyncer.Initialize(info), 42);
    EXPECT_TRUE(log.Has("[ERROR] s2s_rsyncer.cpp("));
    EXPECT_TRUE(log.Has("): Fail to lookup ip for ()\n"));
    EXPECT_FALSE(log.Has("is reachable"));
    EXPECT_EQ(rsyncer.GetServerVersionValue(), -1);
}

TEST(RsyncerKeySync, NothingToSendIsZero) {
    ClientHost host;
    host.AddShare("plain");
    ShareAttrs attrs;
    attrs.encrypted = true;
    host.AddShare("nokey", attrs);
    LogCapture log;
    S2S::Rsyncer rsyncer;
    // A plain share has no key; an encrypted share whose key is not stored here sends nothing.
    EXPECT_EQ(rsyncer.SyncEncryptKey("plain"), 0);
    EXPECT_EQ(rsyncer.SyncEncryptKey("nokey"), 0);
    EXPECT_FALSE(log.Has("rsync_wrapper.cpp"));
    EXPECT_FALSE(log.Has("s2s_rsyncer.cpp"));

    // An unknown share is a local failure: 300 with the platform's error number.
    EXPECT_EQ(rsyncer.SyncEncryptKey("missing"), S2S::kRsyncResultLocalFailure);
    EXPECT_TRUE(log.Has("[ERROR] s2s_rsyncer.cpp("));
    EXPECT_TRUE(log.Has("): Fail to get share 'missing', errno=[" +
                        std::to_string(VLIB_ERR_NOT_FOUND) + "]\n"));
}

}  // namespace
