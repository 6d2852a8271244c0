// The pairing store's writers in several processes at once: no record may be lost, no section
// duplicated, and pairing or conversion must never write back a stale service switch. (A failed
// write or a writer dying mid-way is the section file's matter, tested there.)
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <initializer_list>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/env.h"
#include "s2s_platform.h"
#include "s2s_server.h"
#include "support/test_util.h"

namespace {

constexpr int kWriters = 6;
constexpr int kRounds = 40;

int Update(const std::string& section,
           std::initializer_list<std::pair<std::string, std::string>> pairs) {
    VLIBSzHash* table = VLIBCSzHashAlloc(8);
    for (const auto& pair : pairs) {
        VLIBCSzHashSetValue(&table, pair.first.c_str(), pair.second.c_str());
    }
    int result = S2SUpdateServerInfo(section.c_str(), table);
    VLIBCSzHashFree(table);
    return result;
}

std::string Value(const std::string& section, const char* key) {
    char buf[64];
    int got = VLIBCFileGetSectionValue(S2SPath(S2S_PATH_PAIRING_STORE), section.c_str(), key, buf,
                                       sizeof buf);
    return got >= 0 ? buf : "<absent>";
}

// Writer `id`: its key in a shared section, a section of its own, a new section each round; the
// last also counts the switch up, the first converts and pairs (both rewrite the switch's section).
int Writer(int id) {
    const std::string me = "w" + std::to_string(id);
    for (int round = 0; round < kRounds; ++round) {
        const std::string r = std::to_string(round);
        if (Update("SHARE_common", {{me, r}}) != 0 || Update("TASK_" + me, {{"last", r}}) != 0 ||
            Update("CLIENTID_" + me + "_" + r, {{"ServerName", r}}) != 0) {
            return 1;
        }
        // The switch only counts up: a value other than its last one was written back stale.
        for (int n = round * 5; id == kWriters - 1 && n < round * 5 + 5; ++n) {
            if (Value("PairedClientInfo", "s2sEnabled") != std::to_string(n - 1) ||
                Update("PairedClientInfo", {{"s2sEnabled", std::to_string(n)}}) != 0) {
                return 2;
            }
        }
        for (int n = 0; id == 0 && n < 5; ++n) {
            if (s2s_svr_reset_pair() != 0 ||
                S2SServerUpdatePairInfo(("c" + r).c_str(), "srv") != 0) {
                return 3;
            }
        }
    }
    return 0;
}

TEST(PairingStoreStress, WritersInSeveralProcessesLoseNoRecordAndDuplicateNoSection) {
    // On a memory file system where there is one: the test is about ordering, not the disk.
    s2s_test::ScopedEnv tmp("TMPDIR",
                            access("/dev/shm", W_OK) == 0 ? "/dev/shm" : std::getenv("TMPDIR"));
    s2s_test::TempDir root("s2s-pairing");
    s2s_test::ScopedEnv use_root("S2S_ROOT", root.path().c_str());
    ASSERT_EQ(s2s_platform::Env::Default()->MakeDirs(root.path() + "/usr/vurn/etc"), 0);
    Update("PairedClientInfo", {{"s2sEnabled", "-1"}, {"clientID", "old"}, {"serverName", "o"}});
    std::vector<pid_t> writers;
    for (int id = 0; id < kWriters; ++id) {
        writers.push_back(fork());
        ASSERT_GE(writers.back(), 0);
        if (writers.back() == 0) {
            _exit(Writer(id));
        }
    }
    for (pid_t pid : writers) {
        int status = 0;
        EXPECT_TRUE(waitpid(pid, &status, 0) == pid && status == 0) << status;
    }
    const std::string last = std::to_string(kRounds - 1);
    VLIBSzList* list = VLIBCSzListAlloc(64);
    ASSERT_GE(VLIBCFileEnumSection(S2SPath(S2S_PATH_PAIRING_STORE), &list), 0);
    std::multiset<std::string> names;
    for (int i = 0; i < VLIBCSzListCount(list); ++i) {
        names.insert(VLIBCSzListGet(list, i));
    }
    VLIBCSzListFree(list);
    for (int id = 0; id < kWriters; ++id) {
        const std::string me = "w" + std::to_string(id);
        EXPECT_EQ(Value("SHARE_common", me.c_str()), last) << me;
        EXPECT_EQ(Value("TASK_" + me, "last"), last) << me;
        EXPECT_EQ(names.count("CLIENTID_" + me + "_" + last), 1u) << me;
    }
    EXPECT_EQ(std::set<std::string>(names.begin(), names.end()).size(), names.size());
    EXPECT_EQ(Value("PairedClientInfo", "s2sEnabled"), std::to_string(kRounds * 5 - 1));
    EXPECT_EQ(Value("PairedClientInfo", "clientID"), "S2SMULTI-SRC-SUPPORT");
    EXPECT_EQ(Value("CLIENTID_old", "ServerName"), "o");
    EXPECT_EQ(Value("CLIENTID_c" + last, "ServerName"), "srv");
}

}  // namespace
