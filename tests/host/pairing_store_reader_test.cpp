// The pairing store's typed reader on a real file: every record kind from one read, each share's
// binding by the store's own rule (the one S2SCheckIfSharePaired decides on), and the typed
// writers' layout.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <string>

#include "host/pairing_store.h"
#include "s2s_platform.h"
#include "s2s_server.h"
#include "support/test_util.h"

namespace {

using S2S::PairingStore::ShareBinding;
using S2S::PairingStore::StoreContents;

class PairingStoreReader : public ::testing::Test {
  protected:
    PairingStoreReader() : env_("S2S_ROOT", root_.path().c_str()) {
        for (const char* dir : {"/usr", "/usr/vurn", "/usr/vurn/etc"}) {
            mkdir((root_.path() + dir).c_str(), 0755);
        }
    }
    s2s_test::TempDir root_{"s2s-reader"};
    s2s_test::ScopedEnv env_;
};

TEST_F(PairingStoreReader, ReadsEveryRecordKindWithTheStoresOwnBinding) {
    s2s_test::WriteFile(
        S2SPath(S2S_PATH_PAIRING_STORE),
        "[PairedClientInfo]\n\ts2sEnabled=\"yes\"\n"
        "\tclientID=\"S2SMULTI-SRC-SUPPORT\"\n\tserverName=\"S2SMULTI-SRC-SUPPORT\"\n"
        "[CLIENTID_SN1]\n\tServerName=\"one\"\n"
        "[SHARE_run]\n\tCompleteID=\"SN2\"\n\tRunningID=\"SN1\"\n"
        "\tLastStart=\"100\"\n"
        "[SHARE_done]\n\tCompleteID=\"SN1\"\n\tRunningID=\"SN1\"\n"
        "\tLastResult=\"complete\"\n\tLastTime=\"200\"\n"
        "[SHARE_free]\n\tCompleteID=\"SN1\"\n\tRunningID=\"\"\n"
        "[SHARE_nocomplete]\n\tRunningID=\"SN1\"\n"
        "[SHARE_norunning]\n\tCompleteID=\"SN1\"\n"
        "[TASK_SN1/t]\n\tstatus=\"idle\"\n");
    StoreContents store;
    ASSERT_EQ(S2S::PairingStore::ReadStore(&store), 0);
    EXPECT_EQ(store.pairedClientID, S2S::PairingStore::kMultiClientMarker);
    ASSERT_EQ(store.clients.size(), 1u);
    EXPECT_EQ(store.clients[0].serverName, "one");
    ASSERT_EQ(store.tasks.size(), 1u);
    EXPECT_EQ(store.tasks[0].key, "SN1/t");
    EXPECT_EQ(store.CountTasks("SN1/"), 1);

    const struct {
        const char* name;
        ShareBinding binding;
        const char* owner;
    } expected[] = {{"run", ShareBinding::kRunning, "SN1"},
                    {"done", ShareBinding::kCompleted, "SN1"},
                    {"free", ShareBinding::kFree, ""},
                    {"nocomplete", ShareBinding::kFree, ""},
                    {"norunning", ShareBinding::kUnreadable, ""}};
    ASSERT_EQ(store.shares.size(), 5u);
    for (const auto& e : expected) {
        const S2S::PairingStore::StoreShare* share = store.FindShare(e.name);
        ASSERT_NE(share, nullptr) << e.name;
        EXPECT_EQ(share->binding, e.binding) << e.name;
        EXPECT_EQ(share->owner, e.owner) << e.name;
    }
    EXPECT_EQ(*store.FindShare("run")->fields.lastStart, "100");
    EXPECT_FALSE(store.FindShare("run")->fields.lastResult.has_value());
}

TEST_F(PairingStoreReader, TypedWritesLandInTheStoresLayout) {
    S2S::PairingStore::ShareFields fields;
    fields.runningID = "SN1";
    fields.completeID = "";
    ASSERT_EQ(S2S::PairingStore::UpdateShareRecord("docs", fields), 0);
    ASSERT_EQ(S2S::PairingStore::RecordTaskStatus("SN1/t", "123"), 0);
    EXPECT_EQ(s2s_test::ReadFile(S2SPath(S2S_PATH_PAIRING_STORE)),
              "[SHARE_docs]\n\tRunningID=\"SN1\"\n\tCompleteID=\"\"\n"
              "[TASK_SN1/t]\n\tstatus=\"123\"\n");

    StoreContents store;
    ASSERT_EQ(S2S::PairingStore::ReadStore(&store), 0);
    EXPECT_TRUE(store.FindShare("docs")->fields.Holds(fields));
    fields.runningID = "SN2";
    EXPECT_FALSE(store.FindShare("docs")->fields.Holds(fields));
    EXPECT_EQ(store.FindShare("docs")->binding, ShareBinding::kRunning);
}

}  // namespace
