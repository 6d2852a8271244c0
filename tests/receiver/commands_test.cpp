// The receiver's command handlers on a real pairing store: which command files are well formed,
// and the exchange's answers (result code, output file, the binding left in the store) for a
// sequence of commands from several clients, old-server answers included; plus the early hook
// that puts answers into the spool. The texts are those of the wire.
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "gtest/gtest.h"
#include "s2s_platform.h"
#include "s2s_receiver.h"
#include "support/program.h"
#include "support/tree_manifest.h"

namespace {

namespace fs = std::filesystem;

const std::string kToken = "0123456789abcdef0123456789abcdef";
const std::string kHead = "token=\"" + kToken + "\"\n";

// A receiver's root with its share registry; no daemon.
class Handlers : public ::testing::Test {
  protected:
    Handlers() : env_("S2S_ROOT", dir_.path().c_str()) {
        fs::create_directories(dir_.path() + "/usr/vurn/etc");
        for (const char* share : {"photos", "docs", "music", "vault", "Ünïcødé"}) {
            const std::string path = dir_.path() + "/volume1/" + share;
            fs::create_directories(path);
            VLIBSzHash* attrs = VLIBCSzHashAlloc(4);
            VLIBCSzHashSetValue(&attrs, "path", path.c_str());
            VLIBCSzHashSetValue(&attrs, "encrypted", share == std::string("vault") ? "yes" : "no");
            EXPECT_EQ(VURNShareSet(share, attrs), 0);
            VLIBCSzHashFree(attrs);
        }
    }
    // "photos" -> "running A" (state, owner, last result), "pairing" -> the paired client and
    // server name.
    static std::string State(const std::string& what) {
        S2S::ReceiverStatus st;
        EXPECT_EQ(S2S::ReceiverGetStatus(&st), 0);
        if (what == "pairing") {
            return st.pairedClientID + " " + st.pairedServerName;
        }
        std::string out;
        for (const auto& s : st.shares) {
            if (s.name == what) {
                out = s.state + (s.owner.empty() ? "" : " " + s.owner) +
                      (s.lastResult.empty() ? "" : " " + s.lastResult);
            }
        }
        return out;
    }
    static std::string StoreVersion() {  // a rewrite renames a new file over the old one
        struct stat st = {};
        stat(S2SPath(S2S_PATH_PAIRING_STORE), &st);
        return std::to_string(st.st_ino) + ":" + std::to_string(st.st_ctim.tv_nsec);
    }

    s2s_test::TempDir dir_;
    s2s_test::ScopedEnv env_;
};

// `lines` separated by ';' after a closing quote, as the sender writes them, below the token.
S2S::ReceiverAnswer Send(const std::string& lines, bool oldServer = false) {
    std::string text = kHead;
    for (size_t i = 0; i < lines.size(); ++i) {
        const bool split = lines[i] == ';' && i > 0 && lines[i - 1] == '"';
        text += split ? '\n' : lines[i];
    }
    return S2S::ReceiverRunCommand(text + "\n", oldServer);
}

std::string Start(const std::string& client, const std::string& share) {
    return "command=\"S2S_SyncStart\";clientID=\"" + client +
           "\";volumeName=\"volume1\";shareName=\"" + share + "\"";
}
std::string Multi(const std::string& client, const std::string& shares, const char* dryRun) {
    return "command=\"S2S_PairingMultiSrc\";clientID=\"" + client + "\";serverName=\"host-" +
           client + "\";syncShares=\"" + shares + "\";dryRun=\"" + dryRun + "\";outfile=\"/x\"";
}
std::string Finish(const std::string& client, const std::string& type, const std::string& share) {
    return "command=\"S2S_SyncFinish\";clientID=\"" + client + "\";finishType=\"" + type +
           "\";name=\"" + share + "\"";
}
std::string Task(const std::string& client, const std::string& name) {
    return "command=\"S2S_UpdateTaskStatus\";clientID=\"" + client + "\";taskName=\"" + name + "\"";
}

TEST_F(Handlers, MalformedCommandFilesAreRefusedAndStillAnsweredByToken) {
    const std::string ver = "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\n";
    const struct {
        std::string input;
        int result;
    } cases[] = {
        {kHead, 203},
        {kHead + "clientID=\"A\"\ncommand=\"S2S_GetProtocolVer\"\n", 203},
        {kHead + ver + "outfile=\"/x\"\noutfile=\"/y\"\n", 203},
        {kHead + "command=\"S2S_GetProtocolVer\"\r\nclientID=\"A\"\n", 203},
        {kHead + ver + "\noutfile=\"/x\"\n", 203},
        {kHead + ver + "outfile=/x\n", 203},
        {kHead + ver + "1key=\"v\"\n", 203},
        {kHead + ver + "outfile=\"a\tb\"\n", 203},
        {kHead + ver + "outfile=\"/x\"", 203},
        {kHead + ver + std::string(5000, 'x') + "\n", 203},
        {kHead + "command=\"S2S_GetProtocolVer\"\nclientID=\"../../etc\"\n", 203},
        {kHead + "command=\"S2S_GetProtocolVer\"\nclientID=\"" + std::string(36, 'c') + "\"\n",
         203},
        {kHead + "command=\"S2S_GetProtocolVer\"\nclientID=\"S2SMULTI-SRC-SUPPORT\"\n", 203},
        {kHead + "command=\"S2S_GetProtocolVer\"\nclientID=\"s2smulti-src-support\"\n", 203},
        {kHead + ver, 201},
        {kHead + ver + "outfile=\"\"\n", 201},
        {kHead + ver + "outfile=\"/x\"\nextra=\"1\"\n", 202},
        {kHead + "command=\"rm -rf /\"\nclientID=\"A\"\n", 43},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.input.substr(0, 120));
        const S2S::ReceiverAnswer a = S2S::ReceiverRunCommand(c.input, false);
        EXPECT_EQ(a.result, c.result);
        EXPECT_EQ(a.token, kToken);
        EXPECT_FALSE(a.hasOutput);
    }
    // Without a valid token line no reply can be placed anywhere.
    for (const std::string& bad : {std::string("token=\"../../../etc\"\n"),
                                   "token=\"" + std::string(32, 'A') + "\"\n", std::string()}) {
        EXPECT_EQ(S2S::ReceiverRunCommand(bad + ver + "outfile=\"/x\"\n", false).token, "") << bad;
    }
}

// One store, commands in order: each row's answer depends on the rows before it.
TEST_F(Handlers, CommandExchangeAnswersInOrder) {
    const std::string attrs = ";isAutomount=\"0\";isEnableACL=\"1\";isWinShare=\"0\"";
    const std::string keyLen = ";lenEncKey=\"32\"";
    struct Row {
        bool oldServer;
        std::string lines;
        int result;
        const char* output = nullptr;  // nullptr: no output file
        const char* what = nullptr;    // what State() looks at afterwards
        const char* state = nullptr;
        // 1: the pairing store was rewritten, 0: left alone (every write is a synced rewrite of
        // the whole file, and a resync repeats pairing and finish with the same values).
        int rewritten = -1;
    };
    const Row rows[] = {
        // Answered like a server from before multi-source pairing: one client pairs as a whole.
        {true, "command=\"S2S_GetProtocolVer\";clientID=\"A\";outfile=\"/x\"", 43, nullptr},
        {true, Multi("A", "photos", "no"), 43},
        {true, "command=\"S2S_Pairing\";clientID=\"A\";dryRun=\"yes\";serverName=\"host-a\"", 0},
        {true, "command=\"S2S_Pairing\";clientID=\"A\";dryRun=\"no\";serverName=\"host-a\"", 0,
         nullptr, "pairing", "A host-a"},
        {true, "command=\"S2S_Pairing\";clientID=\"B\";dryRun=\"yes\";serverName=\"host-b\"", 207},
        {true, "command=\"S2S_Pairing\";clientID=\"B\";dryRun=\"no\";serverName=\"host-b\"", 207},
        {true, "command=\"S2S_Pairing\";clientID=\"A\";dryRun=\"no\";serverName=\"host-a\"", 0},
        {true, "command=\"S2S_Pairing\";clientID=\"A\";dryRun=\"maybe\";serverName=\"h\"", 203},
        {true, Start("A", "photos") + ";isEncrypt=\"0\"" + attrs + keyLen, 202},
        {true, Start("A", "photos"), 0, nullptr, "photos", "running A"},
        // A current server takes the single client over into the multi-client scheme.
        {false, Multi("B", "docs", "no"), 0, "\n", "pairing",
         "S2SMULTI-SRC-SUPPORT S2SMULTI-SRC-SUPPORT", 1},
        {false, Multi("B", "docs", "no"), 0, "\n", nullptr, nullptr, 0},
        {false, "command=\"S2S_GetProtocolVer\";clientID=\"A\";outfile=\"/x\"", 0, "1\n"},
        {false, Multi("B", "docs:photos", "yes"), 214, "photos\n", nullptr, nullptr, 0},
        {false, Multi("B", "docs:photos", "no"), 214, "photos\n"},
        {false, Start("B", "photos"), 214},
        {false, Finish("B", "unpair", "photos"), 214, nullptr, "photos", "running A"},
        {false, Start("B", "docs"), 0, nullptr, "docs", "running B"},
        {false, Multi("A", "photos:docs", "no"), 214, "docs\n"},
        {false, Start("C", "photos"), 208},
        {false, Task("C", "nightly"), 208},
        {false, Finish("A", "complete", "photos"), 0, nullptr, "photos", "completed A complete", 1},
        {false, Finish("A", "abort", "photos"), 0, nullptr, "photos", "completed A abort", 1},
        {false, Finish("A", "later", "photos"), 211},
        {false, Finish("A", "unpair", "photos"), 0, nullptr, "photos", "free unpair"},
        {false, Start("B", "photos"), 0, nullptr, "photos", "running B unpair"},
        {false, Task("A", "nightly"), 0, nullptr, nullptr, nullptr, 1},
        {false, "command=\"S2S_Pairing\";clientID=\"A\";dryRun=\"no\";serverName=\"renamed\"", 0,
         nullptr, nullptr, nullptr, 1},
        {false, "command=\"S2S_Frobnicate\";clientID=\"A\"", 43},
        // Share attributes must match the share's.
        {false, Start("A", "music") + ";isEncrypt=\"0\"" + attrs + keyLen, 0},
        {false, Start("A", "vault") + ";isEncrypt=\"1\"" + attrs + keyLen, 0},
        {false, Start("A", "vault") + ";isEncrypt=\"0\"" + attrs + keyLen, 210},
        {false, Start("A", "nosuch") + ";isEncrypt=\"0\"" + attrs + keyLen, 209},
        {false, Start("A", "music") + ";isEncrypt=\"yes\"" + attrs + keyLen, 203},
        {false, Start("A", "music") + ";isEncrypt=\"0\"" + attrs, 201},
        {false, "command=\"S2S_SyncStart\";clientID=\"A\";shareName=\"music\"", 201},
        {false, Start("A", "music") + ";extra=\"1\"", 202},
        // Names that could escape a module or split a line; non-ASCII names are fine.
        {false, Start("A", "Ünïcødé"), 0},
        {false, Start("A", "../photos"), 204},
        {false, Start("A", "photos/x"), 204},
        {false, Start("A", ".."), 204},
        {false, Start("A", "a\"b"), 204},
        {false, Start("A", "a'b"), 204},
        {false, Start("A", "@photos@"), 204},
        {false, Start("A", "a\x01z"), 204},
        {false, Start("A", "[global]"), 204},
        {false, Start("A", "a\\b"), 204},
        {false, Start("A", "a  b"), 204},
        {false, Multi("A", "music:../x", "no"), 204},
        {false, Task("A", "t\x7f"), 204},
        {false, Task("A", "a/b"), 204},
        {false, Task("A", "x..y"), 204},
        {false, Task("A", "@t"), 204},
    };
    for (const auto& r : rows) {
        SCOPED_TRACE((r.oldServer ? "old server: " : "") + r.lines);
        const std::string before = StoreVersion();
        const S2S::ReceiverAnswer a = Send(r.lines, r.oldServer);
        EXPECT_EQ(a.result, r.result);
        EXPECT_EQ(a.hasOutput, r.output != nullptr);
        EXPECT_EQ(a.output, r.output ? r.output : "");
        if (r.what != nullptr) {
            EXPECT_EQ(State(r.what), r.state);
        }
        if (r.rewritten >= 0) {
            EXPECT_EQ(StoreVersion() != before, r.rewritten == 1);
        }
    }
    // One client's tasks in the store are bounded (216); known tasks and other clients go on.
    for (int i = 1; i < 64; ++i) {
        ASSERT_EQ(Send(Task("A", "t" + std::to_string(i))).result, 0) << i;
    }
    EXPECT_EQ(Send(Task("A", "one-more")).result, 216);
    EXPECT_EQ(Send(Task("A", "nightly")).result, 0);
    EXPECT_EQ(Send(Task("B", "one-more")).result, 0);
}

// The early hook writes only below the spool, only under a valid token of a live connection,
// never twice into one reply, and its reply goes the moment its connection ends.
TEST_F(Handlers, EarlyHookAnswersIntoTheSpoolOnly) {
    S2S::ReceiverSettings settings;
    settings.user = "u";
    settings.password = "pw";
    settings.handlerPath = std::string(S2S_TOOL_DIR) + "/s2s-receiver";
    std::string error;
    ASSERT_EQ(S2S::ReceiverConfigure(settings, &error), 0) << error;
    auto hook = [](const std::string& input, const std::string& conn) {
        s2s_test::ScopedEnv pid("RSYNC_PID", conn.c_str());
        int fds[2];
        EXPECT_EQ(pipe(fds), 0);
        EXPECT_EQ(write(fds[1], input.data(), input.size()), static_cast<ssize_t>(input.size()));
        close(fds[1]);
        const int rc = S2S::ReceiverHookEarly(fds[0], false);
        close(fds[0]);
        return rc;
    };
    const std::string spool = S2SPath(S2S_PATH_COMMAND_SPOOL);
    const std::string replies = spool + "/replies";
    const std::string conns = spool + "/conns";
    const std::string cmd =
        kHead + "command=\"S2S_GetProtocolVer\"\nclientID=\"A\"\noutfile=\"/x\"\n";
    // Stand-ins for the daemon's connection processes.
    auto first = std::make_unique<s2s_test::Program>(std::vector<std::string>{"/bin/sleep", "600"});
    auto second =
        std::make_unique<s2s_test::Program>(std::vector<std::string>{"/bin/sleep", "600"});
    const std::string one = std::to_string(first->Pid()), two = std::to_string(second->Pid());
    EXPECT_EQ(hook("token=\"../../../../tmp/evil\"\n" + cmd.substr(kHead.size()), one), 1);
    EXPECT_EQ(hook(cmd, "../x"), 1);
    EXPECT_EQ(hook(cmd, "999999999"), 1) << "no such connection";
    EXPECT_TRUE(fs::is_empty(replies));
    EXPECT_EQ(hook(cmd, one), 0);
    EXPECT_EQ(s2s_test::ReadFile(replies + "/" + kToken + "/result"), "0\n");
    EXPECT_EQ(s2s_test::ReadFile(replies + "/" + kToken + "/output"), "1\n");
    EXPECT_EQ(hook(cmd, two), 1) << "a replayed token";
    // The module's unprivileged reader may enter the replies but not list them; nobody else gets
    // past the spool.
    for (const auto& mode : {std::make_pair(spool, 0700u), std::make_pair(replies, 0711u),
                             std::make_pair(replies + "/" + kToken + "/result", 0644u)}) {
        struct stat st;
        ASSERT_EQ(stat(mode.first.c_str(), &st), 0);
        EXPECT_EQ(st.st_mode & 0777, mode.second) << mode.first;
    }
    {
        // The hooks of configurations written by earlier versions still work.
        s2s_test::ScopedEnv pid("RSYNC_PID", one.c_str());
        s2s_test::ScopedEnv other("RSYNC_REQUEST", "@s2s-cmd/ffffffffffffffffffffffffffffffff/");
        EXPECT_NE(S2S::ReceiverHookPre(), 0) << "another connection's reply";
        s2s_test::ScopedEnv own("RSYNC_REQUEST", ("@s2s-cmd/" + kToken + "/").c_str());
        EXPECT_EQ(S2S::ReceiverHookPre(), 0);
    }
    // The watcher the hook left removes reply and record as soon as the connection ends.
    EXPECT_EQ(s2s_test::TreeManifest(conns).size(), 1u);
    first.reset();
    EXPECT_TRUE(s2s_test::WaitFor([&] { return fs::is_empty(replies) && fs::is_empty(conns); }));
    // A record whose connection has ended (its watcher gone with a stopped daemon) goes with the
    // next command.
    const std::string other = "fedcba9876543210fedcba9876543210";
    fs::create_directories(replies + "/" + other);
    s2s_test::WriteFile(replies + "/" + other + "/result", "0\n");
    s2s_test::WriteFile(conns + "/" + two, other + "\n1\n");
    EXPECT_EQ(hook(cmd, two), 0);
    EXPECT_FALSE(fs::exists(replies + "/" + other)) << "the ended connection's reply stayed";
    EXPECT_EQ(s2s_test::ReadFile(replies + "/" + kToken + "/result"), "0\n");
    second.reset();
    EXPECT_TRUE(s2s_test::WaitFor([&] { return fs::is_empty(replies) && fs::is_empty(conns); }));
}

}  // namespace
