// The pairing store on real files under S2S_ROOT: records survive writes of other records, pairing
// moves through its states (one client, many, shares bound to one), the status follows the switch,
// the daemon and the heartbeats, and what the file or its reader cannot take is refused unwritten.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <ctime>
#include <map>
#include <string>
#include <tuple>
#include <vector>

#include "host/pairing_store.h"
#include "s2s_server.h"
#include "support/test_util.h"

namespace {

using s2s_test::Table;
using Pairs = std::map<std::string, std::string>;
using Names = std::vector<std::string>;

constexpr const char* kMarker = "S2SMULTI-SRC-SUPPORT";

// The items of `list`, which is freed.
Names Take(VLIBSzList* list) {
    Names out;
    for (int i = 0; i < VLIBCSzListCount(list); ++i) {
        out.push_back(VLIBCSzListGet(list, i));
    }
    VLIBCSzListFree(list);
    return out;
}

// S2SCheckIfSharePaired of `shares` for `client`: its result, then the shares it refused.
Names Check(const Names& shares, const char* client) {
    VLIBSzList* in = VLIBCSzListAlloc(4);
    VLIBSzList* refused = VLIBCSzListAlloc(4);
    VLIBCSzListPush(&refused, "left over");  // emptied first
    for (const std::string& share : shares) {
        VLIBCSzListPush(&in, share.c_str());
    }
    Names out{std::to_string(S2SCheckIfSharePaired(in, client, &refused))};
    Take(in);
    const Names got = Take(refused);
    out.insert(out.end(), got.begin(), got.end());
    return out;
}

class PairingStore : public ::testing::Test {
  protected:
    PairingStore() : env_("S2S_ROOT", root_.path().c_str()) {
        s2s_test::MakeDirs(root_ / "usr/vurn/etc");
        s2s_test::MakeDirs(root_ / "var/run");
        previous_ = S2S::PairingStore::SetMessageSink([](const char*) {});  // keep syslog quiet
    }
    ~PairingStore() override { S2S::PairingStore::SetMessageSink(previous_); }

    static std::string File() { return S2SPath(S2S_PATH_PAIRING_STORE); }
    static std::string Contents() { return s2s_test::ReadFile(File()); }
    static int Update(const std::string& section,
                      std::initializer_list<std::pair<const char*, std::string>> pairs) {
        Table table(pairs);
        return S2SUpdateServerInfo(section.c_str(), table.get());
    }
    // The pairs of a section as the store reads them.
    static Pairs Read(const std::string& section) {
        Table table;
        S2SGetServerInfo(section.c_str(), table.ptr());
        Pairs out;
        for (int i = 0; i < VLIBCSzHashCount(table.get()); ++i) {
            out[VLIBCSzHashKeyAt(table.get(), i)] = VLIBCSzHashValueAt(table.get(), i);
        }
        return out;
    }
    static Names Sections() {
        VLIBSzList* names = VLIBCSzListAlloc(4);
        VLIBCFileEnumSection(File().c_str(), &names);  // an unreadable file: none
        return Take(names);
    }

    s2s_test::TempDir root_;
    s2s_test::ScopedEnv env_;
    S2S::PairingStore::MessageSink previous_;
};

// The store is made empty once, without a shell: a root whose name the shell would read as more
// than one word, or as a second command, is no command. Only regular files count as existing.
TEST_F(PairingStore, CheckServerInfoCreatesTheFileEmptyOnceAndUsesNoShell) {
    EXPECT_EQ(isFileExist(File().c_str()), 0);
    EXPECT_EQ(S2SCheckServerInfo(), 0);
    EXPECT_EQ(isFileExist(File().c_str()), 1);
    ASSERT_EQ(mkfifo((root_ / "fifo").c_str(), 0600), 0);
    EXPECT_EQ(isFileExist((root_ / "fifo").c_str()) + isFileExist(root_.path().c_str()), 0);
    EXPECT_EQ(Contents(), "");
    ASSERT_EQ(Update("TASK_t", {{"status", "idle"}}), 0);
    EXPECT_EQ(S2SCheckServerInfo(), 0);
    EXPECT_EQ(Read("TASK_t").size(), 1u);  // kept

    const std::string odd = root_ / "it's a;touch injected";
    s2s_test::MakeDirs(odd + "/usr/vurn/etc");
    s2s_test::ScopedEnv env("S2S_ROOT", odd.c_str());
    ASSERT_EQ(chdir(root_.path().c_str()), 0);
    EXPECT_EQ(S2SCheckServerInfo(), 0);
    EXPECT_EQ(isFileExist((odd + "/usr/vurn/etc/vurnS2S.info").c_str()), 1);
    EXPECT_NE(access((root_ / "injected").c_str(), F_OK), 0);
    ASSERT_EQ(chdir("/"), 0);
}

TEST_F(PairingStore, UpdatesKeepOtherKeysAndSectionsAndReadBackAsWritten) {
    Table table;
    EXPECT_EQ(S2SGetServerInfo("SHARE_docs", table.ptr()), 0);  // absent
    ASSERT_EQ(Update("SHARE_docs", {{"CompleteID", "A"}, {"RunningID", "A"}}), 0);
    Table task({{"status", "1700000000"}});
    ASSERT_EQ(S2SServerUpdateTask("7", task.get()), 0);
    EXPECT_NE(Contents().find("\tCompleteID=\"A\"\n\tRunningID=\"A\"\n"), std::string::npos);
    ASSERT_EQ(Update("SHARE_docs", {{"RunningID", ""}, {"Extra", "x y"}}), 0);
    EXPECT_GT(S2SGetServerInfo("SHARE_docs", table.ptr()), 0);
    EXPECT_EQ(Read("SHARE_docs"),
              (Pairs{{"CompleteID", "A"}, {"RunningID", ""}, {"Extra", "x y"}}));
    EXPECT_EQ(Read("TASK_7"), (Pairs{{"status", "1700000000"}}));
    EXPECT_EQ(Sections(), (Names{"SHARE_docs", "TASK_7"}));
    char buf[36];
    EXPECT_TRUE(S2SServerGetShare("docs", "CompleteID", buf, sizeof(buf)) == 1 && buf[0] == 'A');
    EXPECT_LT(S2SServerGetShare("docs", "Missing", buf, sizeof(buf)), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_NOT_FOUND);
    EXPECT_EQ(S2SServerGetShare("docs", "RunningID", buf, 0), -1);
    // Long values and the file syntax's own characters in values come back unchanged.
    const std::string big(4096, 'v'), quoted = "say \"hi\" = [ok] ; # not a comment";
    ASSERT_EQ(Update("TASK_big", {{"status", big}, {"note", quoted}}), 0);
    EXPECT_EQ(Read("TASK_big"), (Pairs{{"status", big}, {"note", quoted}}));
}

// Share names with the file syntax's characters stay in a section of their own; names, keys and
// values the file cannot carry, null arguments, a file that would outgrow its reader, and any
// write to a malformed file are refused and leave the file as it was.
TEST_F(PairingStore, WhatTheFileOrItsReaderCannotTakeIsRefusedWithoutTouchingIt) {
    ASSERT_EQ(Update("SHARE_neighbour", {{"RunningID", "N"}}), 0);
    for (const char* name : {"a]b", "[x]", "a=b", "q\"uote", "it's", "sp ace", "semi;colon"}) {
        Table values({{"RunningID", std::string("id-") + name}});
        ASSERT_EQ(S2SServerUpdateShare(name, values.get()), 0) << name;
        EXPECT_EQ(Read(std::string("SHARE_") + name)["RunningID"], std::string("id-") + name);
    }
    EXPECT_EQ(Read("SHARE_neighbour"), (Pairs{{"RunningID", "N"}}));
    const std::string before = Contents();
    Table plain({{"RunningID", "A"}});
    for (const char* name : {"new\nline", "cr\rshare", "neighbour]\n[SHARE_x"}) {
        EXPECT_EQ(S2SServerUpdateShare(name, plain.get()), -1);
    }
    EXPECT_EQ(S2SServerUpdateTask("trailing ", plain.get()), -1);
    EXPECT_EQ(Update("SHARE_neighbour", {{"RunningID", "two\nlines"}}), -1);
    EXPECT_EQ(Update("SHARE_neighbour", {{"key=", "v"}}), -1);
    EXPECT_EQ(Update("SHARE_neighbour", {{"RunningID", std::string(9000, 'v')}}), -1);
    EXPECT_TRUE(Update("", {{"k", "v"}}) == -1 && S2SUpdateServerInfo("SHARE_docs", nullptr) == -1);
    EXPECT_TRUE(S2SServerUpdateTask(nullptr, plain.get()) == -1 &&
                S2SServerUpdateShare(nullptr, plain.get()) == -1);
    EXPECT_LT(S2SGetServerInfo(nullptr, plain.ptr()), 0);
    EXPECT_EQ(Contents(), before);

    // The reader takes at most VLIB_SECTION_FILE_MAX bytes: a write that would pass it is refused
    // before anything is written, and one that fits still goes through.
    std::string text = "[BIG]\n";
    for (int i = 0; text.size() + 8100 < VLIB_SECTION_FILE_MAX - 100; ++i) {
        text += "\tk" + std::to_string(i) + "=\"" + std::string(8000, 'v') + "\"\n";
    }
    text += "\tpad=\"" + std::string(VLIB_SECTION_FILE_MAX - 100 - text.size() - 8, 'p') + "\"\n";
    s2s_test::WriteFile(File(), text);
    EXPECT_EQ(Update("SHARE_docs", {{"RunningID", std::string(200, 'A')}}), -1);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_TOO_LARGE);
    EXPECT_EQ(Contents(), text);
    EXPECT_EQ(Update("SHARE_docs", {{"RunningID", "A"}}), 0);

    // A malformed file is never rewritten.
    const std::string broken = "[SHARE_docs]\n\tRunningID=\"A\"\nthis is no section file\n";
    s2s_test::WriteFile(File(), broken);
    EXPECT_EQ(Update("SHARE_new", {{"RunningID", "B"}}), -1);
    EXPECT_EQ(S2SServerUpdatePairInfo("A", "serverA"), 205);
    Table pair({{"clientID", "A"}, {"serverName", "serverA"}});
    EXPECT_EQ(S2SServerSetPairValue(pair.get()), 206);
    EXPECT_EQ(S2SServerIfOldClientPaired(), -1);
    EXPECT_EQ(s2s_svr_reset_pair(), -1);
    s2s_svr_status status = {7, 7, nullptr, nullptr};
    EXPECT_EQ(s2s_svr_get_status(&status), -1);
    EXPECT_EQ(status.running, 0);
    EXPECT_EQ(Contents(), broken);
}

TEST_F(PairingStore, ASingleClientIsSetBesideTheSwitchAndMovedOnceToTheMultiClientScheme) {
    EXPECT_EQ(S2SServerSetPairValue(nullptr), 201);
    Table only_id({{"clientID", "A"}});
    EXPECT_EQ(S2SServerSetPairValue(only_id.get()), 202);
    EXPECT_EQ(Read("PairedClientInfo").size(), 0u);
    ASSERT_EQ(Update("PairedClientInfo", {{"s2sEnabled", "yes"}}), 0);
    EXPECT_EQ(S2SServerIfOldClientPaired(), 0);
    Table broken({{"clientID", "A\nB"}, {"serverName", "serverA"}});
    EXPECT_EQ(S2SServerSetPairValue(broken.get()), 205);
    Table pair({{"clientID", "A"}, {"serverName", "serverA"}, {"other", "ignored"}});
    ASSERT_EQ(S2SServerSetPairValue(pair.get()), 0);
    EXPECT_EQ(Read("PairedClientInfo"),
              (Pairs{{"s2sEnabled", "yes"}, {"clientID", "A"}, {"serverName", "serverA"}}));
    ASSERT_EQ(Update("SHARE_docs", {{"RunningID", "A"}}), 0);
    EXPECT_EQ(S2SServerIfOldClientPaired(), 1);

    EXPECT_EQ(s2s_svr_reset_pair(), 0);
    EXPECT_EQ(S2SServerIfOldClientPaired(), 0);
    EXPECT_EQ(Sections(), (Names{"PairedClientInfo", "SHARE_docs", "CLIENTID_A"}));
    EXPECT_EQ(Read("CLIENTID_A"), (Pairs{{"ServerName", "serverA"}}));
    EXPECT_EQ(Read("PairedClientInfo"),
              (Pairs{{"s2sEnabled", "yes"}, {"clientID", kMarker}, {"serverName", kMarker}}));

    // Without a whole client the store is still marked; a client's section is never duplicated.
    s2s_test::WriteFile(File(), "");
    EXPECT_EQ(s2s_svr_reset_pair(), 0);
    EXPECT_EQ(Read("PairedClientInfo"), (Pairs{{"clientID", kMarker}, {"serverName", kMarker}}));
    s2s_test::WriteFile(File(), "");
    ASSERT_EQ(Update("PairedClientInfo", {{"clientID", "A"}}), 0);
    EXPECT_EQ(s2s_svr_reset_pair(), 0);
    EXPECT_EQ(Sections(), Names{"PairedClientInfo"});
    EXPECT_EQ(Read("PairedClientInfo"), (Pairs{{"clientID", kMarker}, {"serverName", kMarker}}));
    s2s_test::WriteFile(File(), "");
    ASSERT_EQ(S2SServerUpdatePairInfo("A", "old name"), 0);
    ASSERT_EQ(Update("PairedClientInfo", {{"clientID", "A"}, {"serverName", "serverA"}}), 0);
    EXPECT_EQ(s2s_svr_reset_pair(), 0);
    EXPECT_EQ(Sections(), (Names{"CLIENTID_A", "PairedClientInfo"}));
    EXPECT_EQ(Read("CLIENTID_A"), (Pairs{{"ServerName", "serverA"}}));
}

TEST_F(PairingStore, UpdatePairInfoRecordsClientsInTheMultiClientScheme) {
    EXPECT_TRUE(S2SServerUpdatePairInfo("", "s") == 201 &&
                S2SServerUpdatePairInfo("A", nullptr) == 201);
    EXPECT_EQ(Contents(), "");
    ASSERT_EQ(Update("PairedClientInfo", {{"s2sEnabled", "yes"}}), 0);
    EXPECT_TRUE(S2SServerUpdatePairInfo("A", "serverA") == 0 &&
                S2SServerUpdatePairInfo("B", "serverB") == 0 &&
                S2SServerUpdatePairInfo("A", "serverA2") == 0);
    EXPECT_EQ(Sections(), (Names{"PairedClientInfo", "CLIENTID_A", "CLIENTID_B"}));
    EXPECT_EQ(Read("CLIENTID_A"), (Pairs{{"ServerName", "serverA2"}}));
    EXPECT_EQ(Read("PairedClientInfo"),
              (Pairs{{"s2sEnabled", "yes"}, {"clientID", kMarker}, {"serverName", kMarker}}));
    const std::string before = Contents();
    EXPECT_EQ(S2SServerUpdatePairInfo("C\nD", "serverC"), 205);
    EXPECT_EQ(Contents(), before);
}

TEST_F(PairingStore, AnOldClientIsPairedOnlyWithAnIdAndANameNotBothTheMarker) {
    // clientID and serverName as stored ("-": absent), and whether an old client is paired.
    const std::string m = kMarker;
    const std::tuple<std::string, std::string, int> cases[] = {
        {"-", "-", 0}, {"A", "-", 0}, {"", "a", 0}, {m, m, 0},
        {m, "a", 1},   {"A", m, 1},   {"A", "a", 1}};
    for (const auto& [id, name, expected] : cases) {
        std::string text = "[PairedClientInfo]\n\ts2sEnabled=\"yes\"\n";
        text += id == "-" ? "" : "\tclientID=\"" + id + "\"\n";
        text += name == "-" ? "" : "\tserverName=\"" + name + "\"\n";
        s2s_test::WriteFile(File(), text);
        EXPECT_EQ(S2SServerIfOldClientPaired(), expected) << id << " / " << name;
    }
    s2s_test::WriteFile(File(), "");
    EXPECT_EQ(S2SServerIfOldClientPaired(), 0);  // no pairing section at all
}

// A share is another client's while that client runs it, or once it completed it and nobody
// else runs it; a share without a section is free.
TEST_F(PairingStore, SharesBoundToAnotherClientAreRefused) {
    // A share's CompleteID and RunningID.
    const std::tuple<const char*, const char*, const char*> ids[] = {
        {"runA", "", "A"},       {"runB", "", "B"},      {"doneB", "B", "B"},
        {"doneAnowB", "A", "B"}, {"doneBidle", "B", ""}, {"blank", "", ""}};
    for (const auto& [share, complete, running] : ids) {
        Table values({{"CompleteID", complete}, {"RunningID", running}});
        ASSERT_EQ(S2SServerUpdateShare(share, values.get()), 0);
    }
    const Names all{"runA", "runB", "doneB", "doneAnowB", "doneBidle", "blank", "nosection"};
    EXPECT_EQ(Check(all, "A"), (Names{"214", "runB", "doneB", "doneAnowB"}));
    EXPECT_EQ(Check(all, "B"), (Names{"214", "runA"}));
    EXPECT_EQ(Check({"runA", "blank", "doneBidle", "nosection", "new\nline"}, "A"), Names{"0"});
    // An empty share name takes the previous share's status.
    EXPECT_EQ(Check({"runB", ""}, "A"), (Names{"214", "runB", ""}));
    // Missing arguments; a section without RunningID, or an ID too long for its 36-byte field,
    // cannot be read.
    EXPECT_EQ(Check({}, "A"), (Names{"201", "left over"}));
    EXPECT_EQ(Check(all, ""), (Names{"201", "left over"}));
    ASSERT_EQ(Update("SHARE_half", {{"CompleteID", "A"}}), 0);
    ASSERT_EQ(Update("SHARE_long", {{"CompleteID", std::string(36, 'x')}, {"RunningID", "A"}}), 0);
    EXPECT_TRUE(Check({"half"}, "A") == Names{"206"} && Check({"long"}, "A") == Names{"206"});
    // The caller may hand in no list and get a new one, but must hand in where to put it.
    VLIBSzList* shares = VLIBCSzListAlloc(4);
    VLIBCSzListPush(&shares, "runB");
    VLIBSzList* fresh = nullptr;
    EXPECT_EQ(S2SCheckIfSharePaired(shares, "A", &fresh), 214);
    EXPECT_EQ(Take(fresh), Names{"runB"});
    EXPECT_EQ(S2SCheckIfSharePaired(shares, "A", nullptr), 201);
    Take(shares);
}

// Running needs the switch on ("yes" exactly) and a live rsync daemon; the owner is the single
// client recorded. Busy while some task's heartbeat is less than 120 seconds old, or in the
// future (the two servers' clocks need not agree); idle, missing or garbage heartbeats are not.
TEST_F(PairingStore, StatusFollowsTheSwitchTheDaemonAndTheHeartbeats) {
    s2s_svr_status status = {-1, -1, nullptr, nullptr};
    auto get = [&status] {
        s2s_svr_put_status(&status);
        EXPECT_EQ(s2s_svr_get_status(&status), 0);
        return std::to_string(status.running) + std::to_string(status.busy) + " " +
               (status.client_id ? status.client_id : "(null)") + "/" +
               (status.server_name ? status.server_name : "(null)");
    };
    ASSERT_EQ(Update("PairedClientInfo", {{"s2sEnabled", "yes"}}), 0);
    EXPECT_EQ(get(), "00 (null)/(null)");  // no pid file
    ASSERT_EQ(Update("PairedClientInfo", {{"clientID", "A"}, {"serverName", "serverA"}}), 0);
    const std::string pid_file = S2SPath(S2S_PATH_RSYNCD_PID);
    s2s_test::WriteFile(pid_file, std::to_string(getpid()) + "\n");
    EXPECT_EQ(get(), "10 A/serverA");
    for (const char* off : {"Yes", "no"}) {
        ASSERT_EQ(Update("PairedClientInfo", {{"s2sEnabled", off}}), 0);
        EXPECT_EQ(get(), "00 A/serverA") << off;
    }

    const long now = time(nullptr);
    for (const auto& [task, beat] : {std::pair<const char*, std::string>{"TASK_idle", "idle"},
                                     {"TASK_garbage", "garbage"},
                                     {"SHARE_TASK_x", std::to_string(now)},
                                     {"TASK_old", std::to_string(now - 120)}}) {
        ASSERT_EQ(Update(task, {{"status", beat}}), 0);
    }
    ASSERT_EQ(Update("TASK_none", {{"other", "1"}}), 0);
    EXPECT_EQ(get()[1], '0');
    ASSERT_EQ(Update("TASK_recent", {{"status", std::to_string(now - 60)}}), 0);
    EXPECT_EQ(get()[1], '1');
    ASSERT_EQ(Update("TASK_recent", {{"status", std::to_string(now + 3600)}}), 0);
    EXPECT_EQ(get()[1], '1');
    s2s_svr_put_status(&status);
    EXPECT_EQ(status.client_id, nullptr);
    EXPECT_TRUE(s2s_svr_get_status(nullptr) == -1 && s2s_svr_put_status(nullptr) == 0);
}

}  // namespace
