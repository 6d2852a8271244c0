// The receiver's batched store writer: updates other live writers have waiting go into the same
// replacement, those of ended writers are dropped, and a write that changes nothing is skipped.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <set>
#include <string>

#include "host/pairing_store.h"
#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

ino_t StoreInode() {
    struct stat st = {};
    stat(S2SPath(S2S_PATH_PAIRING_STORE), &st);
    return st.st_ino;
}

TEST(PairingStoreBatch, WritesWaitingUpdatesOfLiveWritersAndSkipsNoOps) {
    s2s_test::TempDir root("s2s-batch");
    s2s_test::ScopedEnv env("S2S_ROOT", root.path().c_str());
    const std::string queue = root.path() + "/usr/vurn/etc/.vurnS2S.info.queue";
    ASSERT_EQ(system(("mkdir -p -m 700 " + queue).c_str()), 0);
    const pid_t ended = fork();
    if (ended == 0) {
        _exit(0);
    }
    waitpid(ended, nullptr, 0);
    using S2S::PairingStore::RequestName;
    // A live writer's request (its value of SN1/t loses to the holder's own), an ended writer's,
    // one of a process that had the parent's pid before, and a file that is no request at all.
    s2s_test::WriteFile(queue + "/" + RequestName(getppid(), 1),
                        "[TASK_SN2/t]\n\tstatus=\"5\"\n[TASK_SN1/t]\n\tstatus=\"8\"\n");
    s2s_test::WriteFile(queue + "/" + RequestName(ended, 1), "[TASK_SN3/t]\n\tstatus=\"6\"\n");
    s2s_test::WriteFile(queue + "/" + std::to_string(getppid()) + "-1-2",
                        "[TASK_SN4/t]\n\tstatus=\"6\"\n");
    s2s_test::WriteFile(queue + "/notes.txt", "[pair]\n\tclientID=\"EVIL\"\n");
    s2s_test::WriteFile(queue + "/." + RequestName(ended, 2), "[TASK_SN5/t]\n\tsta");  // killed
    for (const char* odd : {"123", ".1--2", ".-"}) {  // not request names: never touched
        s2s_test::WriteFile(queue + "/" + odd, "[TASK_SN6/t]\n\tstatus=\"6\"\n");
    }

    ASSERT_EQ(S2S::PairingStore::RecordTaskStatus("SN1/t", "4"), 0);
    S2S::PairingStore::StoreContents store;
    ASSERT_EQ(S2S::PairingStore::ReadStore(&store), 0);
    ASSERT_NE(store.FindTask("SN2/t"), nullptr) << "a waiting writer's update was not written";
    EXPECT_EQ(store.FindTask("SN3/t"), nullptr) << "an ended writer's update was written";
    EXPECT_EQ(store.FindTask("SN4/t"), nullptr) << "a request of a reused pid was written";
    ASSERT_NE(store.FindTask("SN1/t"), nullptr);
    EXPECT_EQ(store.FindTask("SN1/t")->status, "4") << "the holder's update was not applied last";
    EXPECT_EQ(store.pairedClientID, "") << "a file that is no request was applied";
    std::set<std::string> left;
    for (const auto& entry : std::filesystem::directory_iterator(queue)) {
        left.insert(entry.path().filename().string());
    }
    EXPECT_EQ(left, (std::set<std::string>{".-", ".1--2", "123", "notes.txt"}))
        << "requests left, or a file that is no request removed";
    EXPECT_EQ(store.FindTask("SN6/t"), nullptr) << "a file that is no request was applied";

    const ino_t written = StoreInode();
    ASSERT_EQ(S2S::PairingStore::RecordTaskStatus("SN1/t", "4"), 0);
    EXPECT_EQ(StoreInode(), written) << "a write that changes nothing replaced the store";
    ASSERT_EQ(S2S::PairingStore::RecordTaskStatus("SN1/t", "7"), 0);
    EXPECT_NE(StoreInode(), written) << "a changed heartbeat was not written";
}

}  // namespace
