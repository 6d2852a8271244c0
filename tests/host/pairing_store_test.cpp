// The pairing store's behaviour on real files under a temporary S2S_ROOT: the layout it writes,
// its result codes and messages, the move to the multi-client scheme, the share pairing rules,
// the server status, and what bad input does (and does not do) to the file.
#include <dlfcn.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstddef>
#include <cstdio>
#include <ctime>
#include <string>

#include "tests/host/pairing_store_test_support.h"

namespace {

using pairing_test::List;
using pairing_test::MessageCapture;
using pairing_test::Pairs;
using pairing_test::ReadSection;
using pairing_test::SectionNames;
using pairing_test::StoreFile;
using pairing_test::StoreRoot;
using pairing_test::Table;
using pairing_test::Update;
using ::testing::ElementsAre;
using Messages = std::vector<std::string>;

constexpr const char* kMarker = "S2SMULTI-SRC-SUPPORT";

static_assert(offsetof(s2s_svr_status, running) == 0, "status record layout");
static_assert(offsetof(s2s_svr_status, busy) == 4, "status record layout");
static_assert(offsetof(s2s_svr_status, client_id) == 8, "status record layout");
static_assert(offsetof(s2s_svr_status, server_name) == 16, "status record layout");

class PairingStoreTest : public ::testing::Test {
  protected:
    StoreRoot root_;
    MessageCapture messages_;
};

// --- the file -----------------------------------------------------------------------------------

TEST_F(PairingStoreTest, IsFileExistAcceptsOnlyRegularFiles) {
    const std::string dir = root_.path();
    s2s_test::WriteFile(dir + "/plain", "x");
    ASSERT_EQ(0, symlink((dir + "/plain").c_str(), (dir + "/link").c_str()));
    ASSERT_EQ(0, symlink((dir + "/gone").c_str(), (dir + "/dangling").c_str()));
    ASSERT_EQ(0, mkfifo((dir + "/fifo").c_str(), 0600));

    EXPECT_EQ(1, isFileExist((dir + "/plain").c_str()));
    EXPECT_EQ(1, isFileExist((dir + "/link").c_str()));
    EXPECT_EQ(0, isFileExist(nullptr));
    EXPECT_EQ(0, isFileExist(""));
    EXPECT_EQ(0, isFileExist((dir + "/missing").c_str()));
    EXPECT_EQ(0, isFileExist((dir + "/dangling").c_str()));
    EXPECT_EQ(0, isFileExist(dir.c_str()));
    EXPECT_EQ(0, isFileExist((dir + "/fifo").c_str()));
}

TEST_F(PairingStoreTest, CheckServerInfoCreatesTheFileEmptyAndKeepsAnExistingOne) {
    EXPECT_EQ(std::string(root_.path()) + "/usr/vurn/etc/vurnS2S.info", StoreFile());
    EXPECT_EQ(0, S2SCheckServerInfo());
    EXPECT_EQ(1, isFileExist(StoreFile()));
    EXPECT_EQ("", root_.Contents());

    ASSERT_EQ(0, Update("TASK_t", {{"status", "idle"}}));
    const std::string before = root_.Contents();
    EXPECT_EQ(0, S2SCheckServerInfo());
    EXPECT_EQ(before, root_.Contents());
}

TEST_F(PairingStoreTest, CreatingTheFileNeverHandsTheRootToTheShell) {
    // A root whose name the shell would read as more than one word, or as a second command.
    const std::string odd = root_.path() + "/it's a;touch injected";
    for (const char* dir : {"", "/usr", "/usr/vurn", "/usr/vurn/etc"}) {
        ASSERT_EQ(0, mkdir((odd + dir).c_str(), 0755));
    }
    s2s_test::ScopedEnv env("S2S_ROOT", odd.c_str());
    char cwd[4096];
    ASSERT_NE(nullptr, getcwd(cwd, sizeof(cwd)));
    ASSERT_EQ(0, chdir(root_.path().c_str()));
    EXPECT_EQ(0, S2SCheckServerInfo());
    ASSERT_EQ(0, chdir(cwd));
    EXPECT_EQ(1, isFileExist((odd + "/usr/vurn/etc/vurnS2S.info").c_str()));
    EXPECT_NE(0, access((root_.path() + "/injected").c_str(), F_OK));
}

TEST_F(PairingStoreTest, WithoutAFileStatusIsUnreadableAndNotRunning) {
    s2s_svr_status status = {7, 7, nullptr, nullptr};
    EXPECT_EQ(-1, s2s_svr_get_status(&status));
    EXPECT_EQ(0, status.running);
    EXPECT_EQ(nullptr, status.client_id);
    EXPECT_EQ(1, isFileExist(StoreFile()));  // created on first use
    EXPECT_EQ(0, s2s_svr_put_status(&status));
}

TEST_F(PairingStoreTest, UpdateWritesTheLineFormatAndKeepsOtherKeysAndSections) {
    ASSERT_EQ(0, Update("SHARE_docs", {{"CompleteID", "A"}, {"RunningID", "A"}}));
    ASSERT_EQ(0, Update("TASK_7", {{"status", "idle"}}));
    EXPECT_NE(std::string::npos, root_.Contents().find("\tCompleteID=\"A\"\n\tRunningID=\"A\"\n"));

    ASSERT_EQ(0, Update("SHARE_docs", {{"RunningID", ""}, {"Extra", "x y"}}));
    int found = 0;
    EXPECT_EQ((Pairs{{"CompleteID", "A"}, {"RunningID", ""}, {"Extra", "x y"}}),
              ReadSection("SHARE_docs", &found));
    EXPECT_GT(found, 0);
    EXPECT_EQ((Pairs{{"status", "idle"}}), ReadSection("TASK_7"));
    EXPECT_THAT(SectionNames(), ElementsAre("SHARE_docs", "TASK_7"));
    EXPECT_TRUE(messages_.Take().empty());
}

TEST_F(PairingStoreTest, TaskAndShareUpdatesNameTheirSections) {
    Table values({{"status", "1700000000"}});
    EXPECT_EQ(0, S2SServerUpdateTask("nightly", values.get()));
    EXPECT_EQ(0, S2SServerUpdateShare("photos", values.get()));
    EXPECT_THAT(SectionNames(), ElementsAre("TASK_nightly", "SHARE_photos"));
    EXPECT_EQ(-1, S2SServerUpdateTask(nullptr, values.get()));
    EXPECT_EQ(-1, S2SServerUpdateShare(nullptr, values.get()));
    EXPECT_EQ(-1, S2SServerUpdateShare("photos", nullptr));
}

TEST_F(PairingStoreTest, GetServerInfoTellsAbsentFromPresent) {
    int found = 99;
    EXPECT_EQ(Pairs{}, ReadSection("PairedClientInfo", &found));
    EXPECT_EQ(0, found);
    ASSERT_EQ(0, Update("PairedClientInfo", {{"s2sEnabled", "yes"}}));
    EXPECT_EQ((Pairs{{"s2sEnabled", "yes"}}), ReadSection("PairedClientInfo", &found));
    EXPECT_GT(found, 0);

    Table table;
    EXPECT_LT(S2SGetServerInfo(nullptr, table.slot()), 0);
    EXPECT_LT(S2SGetServerInfo("PairedClientInfo", nullptr), 0);
}

TEST_F(PairingStoreTest, ServerGetShareReadsOneValue) {
    ASSERT_EQ(0, Update("SHARE_docs", {{"RunningID", "client-1"}}));
    char buf[36];
    EXPECT_EQ(8, S2SServerGetShare("docs", "RunningID", buf, sizeof(buf)));
    EXPECT_STREQ("client-1", buf);

    EXPECT_LT(S2SServerGetShare("docs", "CompleteID", buf, sizeof(buf)), 0);
    EXPECT_EQ(VLIB_ERR_NOT_FOUND, VLIBCErrGet());
    EXPECT_LT(S2SServerGetShare("other", "RunningID", buf, sizeof(buf)), 0);
    EXPECT_EQ(VLIB_ERR_NOT_FOUND, VLIBCErrGet());

    EXPECT_EQ(-1, S2SServerGetShare(nullptr, "RunningID", buf, sizeof(buf)));
    EXPECT_EQ(-1, S2SServerGetShare("docs", nullptr, buf, sizeof(buf)));
    EXPECT_EQ(-1, S2SServerGetShare("docs", "RunningID", nullptr, sizeof(buf)));
    EXPECT_EQ(-1, S2SServerGetShare("docs", "RunningID", buf, 0));
}

TEST_F(PairingStoreTest, UpdateFailuresAreReportedAndLeaveTheFileAsItWas) {
    ASSERT_EQ(0, Update("SHARE_docs", {{"RunningID", "A"}}));
    const std::string before = root_.Contents();
    const std::string file = StoreFile();
    messages_.Take();

    Table values({{"k", "v"}});
    EXPECT_EQ(-1, S2SUpdateServerInfo("", values.get()));
    EXPECT_THAT(messages_.Take(), ElementsAre("VLIBCFileAddSection() failed!! szFile=[" + file +
                                                  "], section=[], errno=[0x0100]",
                                              "Set section [ ] value into [" + file + "] error."));
    EXPECT_EQ(-1, S2SUpdateServerInfo(nullptr, values.get()));
    EXPECT_EQ(-1, S2SUpdateServerInfo("SHARE_docs", nullptr));
    EXPECT_THAT(messages_.Take(),
                ElementsAre("Set section [ ] value into [" + file + "] error.",
                            "Set section [SHARE_docs ] value into [" + file + "] error."));

    // A key the file syntax cannot carry, on an existing section.
    EXPECT_EQ(-1, Update("SHARE_docs", {{"a=b", "v"}}));
    EXPECT_THAT(messages_.Take(),
                ElementsAre("VLIBCFileSetSection() failed!! szFile=[" + file +
                                "], section=[SHARE_docs], errno=[0x0100]",
                            "Set section [SHARE_docs ] value into [" + file + "] error."));
    EXPECT_EQ(before, root_.Contents());
}

// The store's reader takes at most VLIB_SECTION_FILE_MAX bytes: a write that would pass it is
// refused before anything is written, with an error that says so, and a write that fits still
// goes through.
TEST_F(PairingStoreTest, AWriteThatWouldOutgrowTheReaderIsRefused) {
    const std::string file = StoreFile();
    std::string text = "[BIG]\n";
    const std::string value(8000, 'v');
    for (int i = 0; text.size() + 8100 < VLIB_SECTION_FILE_MAX - 100; ++i) {
        text += "\tk" + std::to_string(i) + "=\"" + value + "\"\n";
    }
    text += "\tpad=\"" + std::string(VLIB_SECTION_FILE_MAX - 100 - text.size() - 8, 'p') + "\"\n";
    ASSERT_EQ(text.size(), VLIB_SECTION_FILE_MAX - 100);
    s2s_test::WriteFile(file, text);
    EXPECT_EQ(-1, Update("SHARE_docs", {{"RunningID", std::string(200, 'A')}}));
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_TOO_LARGE);
    EXPECT_EQ(s2s_test::ReadFile(file), text);
    EXPECT_EQ(0, Update("SHARE_docs", {{"RunningID", "A"}}));
    messages_.Take();
}

TEST_F(PairingStoreTest, AMalformedFileIsNeverRewritten) {
    s2s_test::WriteFile(StoreFile(), "[SHARE_docs]\n\tRunningID=\"A\"\nthis is no section file\n");
    const std::string before = root_.Contents();
    const std::string file = StoreFile();

    EXPECT_EQ(-1, Update("SHARE_new", {{"RunningID", "B"}}));
    Messages got = messages_.Take();
    ASSERT_EQ(2u, got.size());
    EXPECT_EQ(
        "VLIBCFileGetSection error. filePath:[" + file + "] szOldSecName:[SHARE_new]  iRet:[-1]",
        got[0]);
    EXPECT_EQ(205, S2SServerUpdatePairInfo("A", "serverA"));
    EXPECT_EQ(-1, S2SServerIfOldClientPaired());
    EXPECT_THAT(messages_.Take(), testing::Contains("Get server paired-info error."));
    EXPECT_EQ(-1, s2s_svr_reset_pair());
    EXPECT_EQ(before, root_.Contents());
}

// --- pairing ------------------------------------------------------------------------------------

TEST_F(PairingStoreTest, SetPairValueSetsTheClientAndKeepsTheSwitch) {
    EXPECT_EQ(201, S2SServerSetPairValue(nullptr));
    Table onlyId({{"clientID", "A"}});
    EXPECT_EQ(202, S2SServerSetPairValue(onlyId.get()));
    Table onlyName({{"serverName", "a"}});
    EXPECT_EQ(202, S2SServerSetPairValue(onlyName.get()));
    EXPECT_EQ(0, ReadSection("PairedClientInfo").size());

    ASSERT_EQ(0, Update("PairedClientInfo", {{"s2sEnabled", "yes"}}));
    Table pair({{"clientID", "A"}, {"serverName", "serverA"}, {"other", "ignored"}});
    EXPECT_EQ(0, S2SServerSetPairValue(pair.get()));
    EXPECT_EQ((Pairs{{"s2sEnabled", "yes"}, {"clientID", "A"}, {"serverName", "serverA"}}),
              ReadSection("PairedClientInfo"));

    Table broken({{"clientID", "A\nB"}, {"serverName", "serverA"}});
    EXPECT_EQ(205, S2SServerSetPairValue(broken.get()));
    EXPECT_EQ("A", ReadSection("PairedClientInfo")["clientID"]);
}

TEST_F(PairingStoreTest, SetPairValueReportsAnUnreadableFile) {
    s2s_test::WriteFile(StoreFile(), "garbage\n");
    Table pair({{"clientID", "A"}, {"serverName", "serverA"}});
    EXPECT_EQ(206, S2SServerSetPairValue(pair.get()));
    EXPECT_EQ("garbage\n", root_.Contents());
}

TEST_F(PairingStoreTest, UpdatePairInfoRecordsAClientInTheMultiClientScheme) {
    EXPECT_EQ(201, S2SServerUpdatePairInfo(nullptr, "s"));
    EXPECT_EQ(201, S2SServerUpdatePairInfo("", "s"));
    EXPECT_EQ(201, S2SServerUpdatePairInfo("A", nullptr));
    EXPECT_EQ(201, S2SServerUpdatePairInfo("A", ""));
    EXPECT_EQ("", root_.Contents());

    ASSERT_EQ(0, Update("PairedClientInfo", {{"s2sEnabled", "yes"}}));
    EXPECT_EQ(0, S2SServerUpdatePairInfo("A", "serverA"));
    EXPECT_EQ(0, S2SServerUpdatePairInfo("B", "serverB"));
    EXPECT_EQ(0, S2SServerUpdatePairInfo("A", "serverA2"));
    EXPECT_THAT(SectionNames(), ElementsAre("PairedClientInfo", "CLIENTID_A", "CLIENTID_B"));
    EXPECT_EQ((Pairs{{"ServerName", "serverA2"}}), ReadSection("CLIENTID_A"));
    EXPECT_EQ((Pairs{{"s2sEnabled", "yes"}, {"clientID", kMarker}, {"serverName", kMarker}}),
              ReadSection("PairedClientInfo"));

    // A client ID that cannot name a section is refused before anything is written.
    const std::string before = root_.Contents();
    EXPECT_EQ(205, S2SServerUpdatePairInfo("C\nD", "serverC"));
    EXPECT_EQ(before, root_.Contents());
}

TEST_F(PairingStoreTest, IfOldClientPairedTellsWhetherASingleClientIsRecorded) {
    struct Case {
        const char* clientId;
        const char* serverName;
        int expected;
    };
    const Case cases[] = {
        {nullptr, nullptr, 0}, {"A", nullptr, 0}, {nullptr, "a", 0},
        {"", "a", 0},          {"A", "", 0},      {kMarker, kMarker, 0},
        {kMarker, "a", 1},     {"A", "a", 1},     {"A", kMarker, 1},
    };
    for (const Case& c : cases) {
        s2s_test::WriteFile(StoreFile(), "");
        Table pair;
        VLIBCSzHashSetValue(pair.slot(), "s2sEnabled", "yes");
        if (c.clientId != nullptr) {
            VLIBCSzHashSetValue(pair.slot(), "clientID", c.clientId);
        }
        if (c.serverName != nullptr) {
            VLIBCSzHashSetValue(pair.slot(), "serverName", c.serverName);
        }
        ASSERT_EQ(0, S2SUpdateServerInfo("PairedClientInfo", pair.get()));
        EXPECT_EQ(c.expected, S2SServerIfOldClientPaired())
            << (c.clientId ? c.clientId : "(none)") << " / "
            << (c.serverName ? c.serverName : "(none)");
    }
    s2s_test::WriteFile(StoreFile(), "");
    EXPECT_EQ(0, S2SServerIfOldClientPaired());  // no pairing section at all
}

TEST_F(PairingStoreTest, ResetPairMovesTheSingleClientToItsOwnSection) {
    ASSERT_EQ(0, Update("PairedClientInfo",
                        {{"s2sEnabled", "yes"}, {"clientID", "A"}, {"serverName", "serverA"}}));
    ASSERT_EQ(0, Update("SHARE_docs", {{"RunningID", "A"}}));
    ASSERT_EQ(1, S2SServerIfOldClientPaired());

    EXPECT_EQ(0, s2s_svr_reset_pair());
    EXPECT_EQ(0, S2SServerIfOldClientPaired());
    EXPECT_THAT(SectionNames(), ElementsAre("PairedClientInfo", "SHARE_docs", "CLIENTID_A"));
    EXPECT_EQ((Pairs{{"ServerName", "serverA"}}), ReadSection("CLIENTID_A"));
    EXPECT_EQ((Pairs{{"s2sEnabled", "yes"}, {"clientID", kMarker}, {"serverName", kMarker}}),
              ReadSection("PairedClientInfo"));
    EXPECT_TRUE(messages_.Take().empty());

    // Again on a converted store: the marker is taken for a client, as callers know.
    EXPECT_EQ(0, s2s_svr_reset_pair());
    EXPECT_THAT(SectionNames(), ElementsAre("PairedClientInfo", "SHARE_docs", "CLIENTID_A",
                                            "CLIENTID_S2SMULTI-SRC-SUPPORT"));
}

TEST_F(PairingStoreTest, ResetPairWithoutAClientStillMarksTheStore) {
    EXPECT_EQ(0, s2s_svr_reset_pair());
    EXPECT_THAT(messages_.Take(), ElementsAre("Failed to get clientID from hash."));
    EXPECT_THAT(SectionNames(), ElementsAre("PairedClientInfo"));
    EXPECT_EQ((Pairs{{"clientID", kMarker}, {"serverName", kMarker}}),
              ReadSection("PairedClientInfo"));

    s2s_test::WriteFile(StoreFile(), "");
    ASSERT_EQ(0, Update("PairedClientInfo", {{"clientID", "A"}}));
    EXPECT_EQ(0, s2s_svr_reset_pair());
    EXPECT_THAT(messages_.Take(), ElementsAre("Failed to get serverName from hash."));
    EXPECT_THAT(SectionNames(), ElementsAre("PairedClientInfo"));
}

TEST_F(PairingStoreTest, ResetPairDoesNotDuplicateAnExistingClientSection) {
    ASSERT_EQ(0, S2SServerUpdatePairInfo("A", "old name"));
    ASSERT_EQ(0, Update("PairedClientInfo", {{"clientID", "A"}, {"serverName", "serverA"}}));
    EXPECT_EQ(0, s2s_svr_reset_pair());
    EXPECT_THAT(SectionNames(), ElementsAre("CLIENTID_A", "PairedClientInfo"));
    EXPECT_EQ((Pairs{{"ServerName", "serverA"}}), ReadSection("CLIENTID_A"));
}

// --- share pairing ------------------------------------------------------------------------------

TEST_F(PairingStoreTest, CheckIfSharePairedRefusesMissingArguments) {
    List shares({"docs"});
    List empty;
    List refused;
    EXPECT_EQ(201, S2SCheckIfSharePaired(nullptr, "A", refused.slot()));
    EXPECT_EQ(201, S2SCheckIfSharePaired(empty.get(), "A", refused.slot()));
    EXPECT_EQ(201, S2SCheckIfSharePaired(shares.get(), nullptr, refused.slot()));
    EXPECT_EQ(201, S2SCheckIfSharePaired(shares.get(), "", refused.slot()));
    EXPECT_EQ(201, S2SCheckIfSharePaired(shares.get(), "A", nullptr));
    EXPECT_EQ(Messages(5, "Input parameters are null or empty!"), messages_.Take());
}

TEST_F(PairingStoreTest, CheckIfSharePairedAppliesTheShareStatusRules) {
    // share: CompleteID / RunningID as stored.
    ASSERT_EQ(0, Update("SHARE_runA", {{"CompleteID", ""}, {"RunningID", "A"}}));
    ASSERT_EQ(0, Update("SHARE_runB", {{"CompleteID", ""}, {"RunningID", "B"}}));
    ASSERT_EQ(0, Update("SHARE_doneB", {{"CompleteID", "B"}, {"RunningID", "B"}}));
    ASSERT_EQ(0, Update("SHARE_doneAnowB", {{"CompleteID", "A"}, {"RunningID", "B"}}));
    ASSERT_EQ(0, Update("SHARE_doneBidle", {{"CompleteID", "B"}, {"RunningID", ""}}));
    ASSERT_EQ(0, Update("SHARE_blank", {{"CompleteID", ""}, {"RunningID", ""}}));
    ASSERT_EQ(0, Update("SHARE_noComplete", {{"RunningID", "B"}}));

    List refused({"left over"});
    List mine({"runA", "blank", "doneBidle", "noComplete", "nosection"});
    EXPECT_EQ(0, S2SCheckIfSharePaired(mine.get(), "A", refused.slot()));
    EXPECT_TRUE(refused.Items().empty());

    List all({"runA", "runB", "doneB", "doneAnowB", "doneBidle", "blank", "nosection"});
    EXPECT_EQ(214, S2SCheckIfSharePaired(all.get(), "A", refused.slot()));
    EXPECT_THAT(refused.Items(), ElementsAre("runB", "doneB", "doneAnowB"));
    EXPECT_EQ(214, S2SCheckIfSharePaired(all.get(), "B", refused.slot()));
    EXPECT_THAT(refused.Items(), ElementsAre("runA"));
    EXPECT_TRUE(messages_.Take().empty());

    // The caller may hand in no list and get a new one.
    VLIBSzList* fresh = nullptr;
    EXPECT_EQ(214, S2SCheckIfSharePaired(all.get(), "C", &fresh));
    EXPECT_EQ(4, VLIBCSzListCount(fresh));
    VLIBCSzListFree(fresh);
}

TEST_F(PairingStoreTest, CheckIfSharePairedReportsUnreadableShares) {
    ASSERT_EQ(0, Update("SHARE_half", {{"CompleteID", "A"}}));
    List shares({"half"});
    List refused;
    EXPECT_EQ(206, S2SCheckIfSharePaired(shares.get(), "A", refused.slot()));
    EXPECT_THAT(messages_.Take(), ElementsAre("Failed to get section [SHARE_half] RunningID value.",
                                              "getSharePairStatus error"));

    // IDs are read into 36-byte buffers: a longer stored ID cannot be read.
    ASSERT_EQ(0, Update("SHARE_long", {{"CompleteID", std::string(36, 'x')}, {"RunningID", "A"}}));
    List longShare({"long"});
    EXPECT_EQ(206, S2SCheckIfSharePaired(longShare.get(), "A", refused.slot()));
    EXPECT_THAT(messages_.Take(),
                ElementsAre("Failed to get section [SHARE_long] CompleteID value.",
                            "getSharePairStatus error"));
}

TEST_F(PairingStoreTest, AnEmptyShareNameTakesThePreviousSharesStatus) {
    ASSERT_EQ(0, Update("SHARE_runB", {{"CompleteID", ""}, {"RunningID", "B"}}));
    List shares({"runB", ""});
    List refused;
    EXPECT_EQ(214, S2SCheckIfSharePaired(shares.get(), "A", refused.slot()));
    EXPECT_THAT(refused.Items(), ElementsAre("runB", ""));
    EXPECT_THAT(messages_.Take(), ElementsAre("Parameter error on getSharePairStatus."));

    List first({"", "nosection"});
    EXPECT_EQ(0, S2SCheckIfSharePaired(first.get(), "A", refused.slot()));
}

// --- status -------------------------------------------------------------------------------------

class PairingStatusTest : public PairingStoreTest {
  protected:
    std::string PidFile() const { return root_.path() + "/var/run/rsyncd.pid"; }

    // Status with the owner and service switch given; the record is released here.
    s2s_svr_status Status(int* result = nullptr) {
        s2s_svr_status status = {-1, -1, nullptr, nullptr};
        int got = s2s_svr_get_status(&status);
        if (result != nullptr) {
            *result = got;
        }
        last_client_ = status.client_id != nullptr ? status.client_id : "(null)";
        last_server_ = status.server_name != nullptr ? status.server_name : "(null)";
        s2s_svr_put_status(&status);
        EXPECT_EQ(nullptr, status.client_id);
        return status;
    }

    std::string last_client_;
    std::string last_server_;
};

TEST_F(PairingStatusTest, RunningNeedsTheSwitchOnAndALiveRsyncDaemon) {
    ASSERT_EQ(0, Update("PairedClientInfo",
                        {{"s2sEnabled", "yes"}, {"clientID", "A"}, {"serverName", "serverA"}}));
    int result = -9;
    EXPECT_EQ(0, Status(&result).running);  // no pid file
    EXPECT_EQ(0, result);
    EXPECT_EQ("A", last_client_);
    EXPECT_EQ("serverA", last_server_);

    s2s_test::WriteFile(PidFile(), std::to_string(getpid()) + "\n");
    EXPECT_EQ(1, Status().running);

    ASSERT_EQ(0, Update("PairedClientInfo", {{"s2sEnabled", "Yes"}}));
    EXPECT_EQ(0, Status().running);
    ASSERT_EQ(0, Update("PairedClientInfo", {{"s2sEnabled", "no"}}));
    EXPECT_EQ(0, Status().running);

    ASSERT_EQ(0, Update("PairedClientInfo", {{"s2sEnabled", "yes"}}));
    pid_t gone = fork();
    if (gone == 0) {
        _exit(0);
    }
    ASSERT_EQ(gone, waitpid(gone, nullptr, 0));
    s2s_test::WriteFile(PidFile(), std::to_string(gone) + "\n");
    EXPECT_EQ(0, Status().running);
}

TEST_F(PairingStatusTest, AbsentOwnerKeysGiveNullStrings) {
    ASSERT_EQ(0, Update("PairedClientInfo", {{"s2sEnabled", "yes"}}));
    int result = -9;
    Status(&result);
    EXPECT_EQ(0, result);
    EXPECT_EQ("(null)", last_client_);
    EXPECT_EQ("(null)", last_server_);
    EXPECT_EQ(-1, s2s_svr_get_status(nullptr));
    EXPECT_EQ(0, s2s_svr_put_status(nullptr));
}

TEST_F(PairingStatusTest, BusyFollowsTheHeartbeatWindow) {
    ASSERT_EQ(0, Update("PairedClientInfo", {{"s2sEnabled", "no"}}));
    EXPECT_EQ(0, Status().busy);
    ASSERT_EQ(0, Update("TASK_idle", {{"status", "idle"}}));
    ASSERT_EQ(0, Update("TASK_none", {{"other", "1"}}));
    ASSERT_EQ(0, Update("SHARE_TASK_x", {{"status", std::to_string(time(nullptr))}}));
    EXPECT_EQ(0, Status().busy);

    ASSERT_EQ(0, Update("TASK_old", {{"status", std::to_string(time(nullptr) - 120)}}));
    EXPECT_EQ(0, Status().busy);
    ASSERT_EQ(0, Update("TASK_old", {{"status", "garbage"}}));
    EXPECT_EQ(0, Status().busy);

    // 119 seconds old is still busy; the clock may tick between writing and reading, so the
    // check counts only when it did not.
    for (int attempt = 0;; ++attempt) {
        const time_t before = time(nullptr);
        ASSERT_EQ(0, Update("TASK_recent", {{"status", std::to_string(before - 119)}}));
        const int busy = Status().busy;
        if (time(nullptr) == before) {
            EXPECT_EQ(1, busy);
            break;
        }
        ASSERT_LT(attempt, 20);
    }
    ASSERT_EQ(0, Update("TASK_recent", {{"status", "idle"}}));
    EXPECT_EQ(0, Status().busy);

    ASSERT_EQ(0, Update("TASK_future", {{"status", std::to_string(time(nullptr) + 3600)}}));
    EXPECT_EQ(1, Status().busy);
}

// --- bad input ----------------------------------------------------------------------------------

TEST_F(PairingStoreTest, ShareNamesWithSyntaxCharactersStayInTheirOwnSection) {
    ASSERT_EQ(0, Update("SHARE_neighbour", {{"RunningID", "N"}}));
    const char* names[] = {"a]b", "[x]", "a=b", "q\"uote", "it's", "sp ace", "semi;colon"};
    for (const char* name : names) {
        Table values({{"RunningID", std::string("id-") + name}, {"CompleteID", ""}});
        ASSERT_EQ(0, S2SServerUpdateShare(name, values.get())) << name;
    }
    for (const char* name : names) {
        char buf[64];
        ASSERT_GE(S2SServerGetShare(name, "RunningID", buf, sizeof(buf)), 0) << name;
        EXPECT_EQ(std::string("id-") + name, buf);
        List shares({name});
        List refused;
        EXPECT_EQ(214, S2SCheckIfSharePaired(shares.get(), "other", refused.slot())) << name;
        EXPECT_EQ(0, S2SCheckIfSharePaired(shares.get(), (std::string("id-") + name).c_str(),
                                           refused.slot()))
            << name;
    }
    EXPECT_EQ((Pairs{{"RunningID", "N"}}), ReadSection("SHARE_neighbour"));
    EXPECT_EQ(8u, SectionNames().size());
}

TEST_F(PairingStoreTest, InputTheFileCannotCarryIsRefusedWithoutTouchingIt) {
    ASSERT_EQ(0, Update("SHARE_neighbour", {{"RunningID", "N"}}));
    const std::string before = root_.Contents();
    Table plain({{"RunningID", "A"}});

    EXPECT_EQ(-1, S2SServerUpdateShare("new\nline", plain.get()));
    EXPECT_EQ(-1, S2SServerUpdateShare("cr\rshare", plain.get()));
    EXPECT_EQ(-1, S2SServerUpdateShare("neighbour]\n[SHARE_x", plain.get()));
    EXPECT_EQ(-1, S2SServerUpdateTask("trailing ", plain.get()));
    EXPECT_EQ(-1, Update("SHARE_neighbour", {{"RunningID", "two\nlines"}}));
    EXPECT_EQ(-1, Update("SHARE_neighbour", {{"key=", "v"}}));
    EXPECT_EQ(-1, Update("SHARE_neighbour", {{"RunningID", std::string(9000, 'v')}}));
    EXPECT_EQ(before, root_.Contents());

    // Such a share can have no section, so nobody holds it.
    List shares({"new\nline"});
    List refused;
    EXPECT_EQ(0, S2SCheckIfSharePaired(shares.get(), "A", refused.slot()));
    EXPECT_EQ(before, root_.Contents());
}

TEST_F(PairingStoreTest, LongAndQuotedValuesRoundTrip) {
    const std::string big(4096, 'v');
    const std::string quoted = "say \"hi\" = [ok] ; # not a comment";
    ASSERT_EQ(0, Update("TASK_big", {{"status", big}, {"note", quoted}}));
    ASSERT_EQ(0, Update("TASK_next", {{"status", "idle"}}));
    EXPECT_EQ((Pairs{{"status", big}, {"note", quoted}}), ReadSection("TASK_big"));
    EXPECT_EQ((Pairs{{"status", "idle"}}), ReadSection("TASK_next"));
    ASSERT_EQ(0, S2SServerUpdatePairInfo(std::string(200, 'c').c_str(), big.c_str()));
    EXPECT_EQ(big, ReadSection("CLIENTID_" + std::string(200, 'c'))["ServerName"]);
}

// --- the C interface ----------------------------------------------------------------------------

TEST(PairingStoreInterfaceTest, TheSharedLibraryExportsUnmangledNames) {
    void* lib = dlopen(S2S_BINARY_DIR "/libs2s.so", RTLD_NOW | RTLD_LOCAL);
    ASSERT_NE(nullptr, lib) << dlerror();
    for (const char* name :
         {"isFileExist", "S2SCheckServerInfo", "S2SGetServerInfo", "S2SServerGetShare",
          "S2SUpdateServerInfo", "S2SServerUpdateTask", "S2SServerUpdateShare",
          "S2SServerSetPairValue", "S2SServerUpdatePairInfo", "S2SServerIfOldClientPaired",
          "s2s_svr_reset_pair", "S2SCheckIfSharePaired", "s2s_svr_get_status",
          "s2s_svr_put_status"}) {
        EXPECT_NE(nullptr, dlsym(lib, name)) << name;
    }
    dlclose(lib);
}

TEST(PairingStoreInterfaceTest, ACProgramUsesTheStore) {
    if (system("cc --version >/dev/null 2>&1") != 0) {
        GTEST_SKIP() << "no C compiler";
    }
    StoreRoot root;
    const std::string source = root.path() + "/use.c";
    const std::string program = root.path() + "/use";
    s2s_test::WriteFile(source, R"(#include <stdio.h>
#include <string.h>
#include "s2s_server.h"
int main(void) {
    VLIBSzHash* values = VLIBCSzHashAlloc(4);
    VLIBSzList* shares = VLIBCSzListAlloc(4);
    VLIBSzList* refused = VLIBCSzListAlloc(4);
    s2s_svr_status status;
    int ok = S2SServerUpdatePairInfo("A", "serverA") == 0;
    VLIBCSzHashSetValue(&values, "CompleteID", "");
    VLIBCSzHashSetValue(&values, "RunningID", "B");
    ok = ok && S2SServerUpdateShare("docs", values) == 0;
    VLIBCSzListPush(&shares, "docs");
    ok = ok && S2SCheckIfSharePaired(shares, "A", &refused) == 214;
    ok = ok && s2s_svr_get_status(&status) == 0 && status.running == 0 &&
         strcmp(status.client_id, "S2SMULTI-SRC-SUPPORT") == 0;
    s2s_svr_put_status(&status);
    VLIBCSzListFree(refused);
    VLIBCSzListFree(shares);
    VLIBCSzHashFree(values);
    puts(ok ? "ok" : "failed");
    return ok ? 0 : 1;
}
)");
#ifdef __SANITIZE_ADDRESS__
    // The library carries the sanitizers' runtime, which must come first in the program.
    const std::string sanitize = " -fsanitize=address,undefined -fno-sanitize-recover=all";
#else
    const std::string sanitize;
#endif
    const std::string compile =
        "cc" + sanitize +
        " -std=c11 -Wall -Wextra -Wpedantic -Werror -I " S2S_SOURCE_DIR "/include -o '" + program +
        "' '" + source + "' -L " S2S_BINARY_DIR " -ls2s -Wl,-rpath," S2S_BINARY_DIR;
    ASSERT_EQ(0, system(compile.c_str())) << compile;
    EXPECT_EQ(0, system(("'" + program + "'").c_str()));
}

}  // namespace
