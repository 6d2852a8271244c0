// End-to-end scenarios of `s2s sync` against a real receiver (s2s-receiver and its rsync daemon):
// what arrives on the receiving server after a first sync, an incremental one, deletions, a
// receiver restarted in the middle of a transfer, shares registered on the receiver late or not
// at all, and the guards that keep an empty or unmounted source and an oversized deletion from
// wiping the receiver's copy.
#include <gtest/gtest.h>
#include <sys/mount.h>

#include "tools/s2s_scenario.h"

namespace {

using namespace s2s_scenario;
using s2s_test::ReadFile;
using s2s_test::WaitFor;
using s2s_test::WriteFile;

const char kUser[] = "backup";
const char kPassword[] = "correct horse battery";

class SyncScenario : public ::testing::Test {
  protected:
    void SetUp() override {
        if (!EnterPrivateNetwork()) {
            GTEST_SKIP() << "needs root and network namespaces";
        }
        receiver_.reset(new Receiver(kUser, kPassword));
        sender_.reset(new Sender("sender", "SN-SENDER-A", kPassword));
        for (const char* share : {"docs", "media"}) {
            sender_->AddShare(share);
            receiver_->AddShare(share);
        }
        ASSERT_EQ(receiver_->Configure().status, 0);
        const Result started = receiver_->Start();
        ASSERT_EQ(started.status, 0) << started.All();
    }

    void ExpectSame(const std::string& share) const {
        EXPECT_EQ(Manifest(sender_->SharePath(share)), Manifest(receiver_->SharePath(share)))
            << "share " << share;
    }

    std::unique_ptr<Receiver> receiver_;
    std::unique_ptr<Sender> sender_;
};

TEST_F(SyncScenario, FirstSyncCopiesEveryShareAndMarksItComplete) {
    GenerateFiles(sender_->SharePath("docs") + "/a/b", 30, 700, 1);
    GenerateFiles(sender_->SharePath("docs"), 5, 10, 2);
    GenerateFiles(sender_->SharePath("media") + "/deep/er/still", 3, 50000, 3);
    WriteFile(sender_->SharePath("docs") + "/name with spaces and \xc3\xa9", "x");
    ASSERT_EQ(symlink("a/b/file1", (sender_->SharePath("docs") + "/link").c_str()), 0);
    // Deeper than any fixed limit of a tree walk: its file is counted too.
    std::string deep = sender_->SharePath("media");
    for (int level = 0; level < 300; ++level) {
        deep += "/d";
    }
    MakeDirs(deep);
    WriteFile(deep + "/bottom", "deep");

    const Result r = sender_->Sync(kUser, {"docs", "media"}, {"--json"});
    ASSERT_EQ(r.status, 0) << r.All();
    ExpectSame("docs");
    ExpectSame("media");

    // The summary is for machines: the result by name, and per share what was synced.
    EXPECT_NE(r.out.find("\"result\": \"ok\""), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("\"files\": 40"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("\"state\": \"synced\""), std::string::npos) << r.out;
    // The human lines went to standard error, out of the JSON's way.
    EXPECT_NE(r.err.find("paired 2 shares"), std::string::npos) << r.err;

    const Result status = receiver_->Status();
    EXPECT_NE(status.out.find("share: docs bound to SN-SENDER-A, last sync completed"),
              std::string::npos)
        << status.out;
    EXPECT_NE(status.out.find("share: media bound to SN-SENDER-A, last sync completed"),
              std::string::npos)
        << status.out;
    EXPECT_NE(status.out.find("client: SN-SENDER-A"), std::string::npos) << status.out;
}

TEST_F(SyncScenario, IncrementalSyncSendsOnlyWhatChanged) {
    GenerateFiles(sender_->SharePath("docs") + "/big", 20, 200000, 4);
    GenerateFiles(sender_->SharePath("docs") + "/small", 10, 100, 5);
    Result r = sender_->Sync(kUser, {"docs"}, {"--json"});
    ASSERT_EQ(r.status, 0) << r.All();

    // Nothing changed: rsync reads next to nothing of the 4 MB.
    r = sender_->Sync(kUser, {"docs"}, {"--json"});
    ASSERT_EQ(r.status, 0) << r.All();
    const size_t at = r.out.find("\"read_bytes\": ");
    ASSERT_NE(at, std::string::npos) << r.out;
    EXPECT_LT(std::stoull(r.out.substr(at + 14)), 1000000u) << r.out;

    // A changed, a grown and a new file arrive; the others stay as they were.
    WriteFile(sender_->SharePath("docs") + "/small/file3", "changed content");
    WriteFile(sender_->SharePath("docs") + "/small/file4",
              ReadFile(sender_->SharePath("docs") + "/small/file4") + "more");
    WriteFile(sender_->SharePath("docs") + "/small/new", "new");
    r = sender_->Sync(kUser, {"docs"});
    ASSERT_EQ(r.status, 0) << r.All();
    ExpectSame("docs");
    EXPECT_EQ(ReadFile(receiver_->SharePath("docs") + "/small/file3"), "changed content");
    EXPECT_EQ(ReadFile(receiver_->SharePath("docs") + "/small/new"), "new");
}

TEST_F(SyncScenario, DeletionsPropagate) {
    GenerateFiles(sender_->SharePath("docs") + "/keep", 5, 100, 6);
    GenerateFiles(sender_->SharePath("docs") + "/gone/sub", 5, 100, 7);
    Result r = sender_->Sync(kUser, {"docs"});
    ASSERT_EQ(r.status, 0) << r.All();
    ASSERT_TRUE(IsPathThere(receiver_->SharePath("docs") + "/gone/sub/file1"));

    ASSERT_EQ(unlink((sender_->SharePath("docs") + "/keep/file2").c_str()), 0);
    s2s_test::RemoveTree(sender_->SharePath("docs") + "/gone");
    r = sender_->Sync(kUser, {"docs"});
    ASSERT_EQ(r.status, 0) << r.All();
    ExpectSame("docs");
    EXPECT_FALSE(IsPathThere(receiver_->SharePath("docs") + "/keep/file2"));
    EXPECT_FALSE(IsPathThere(receiver_->SharePath("docs") + "/gone"));
    EXPECT_TRUE(IsPathThere(receiver_->SharePath("docs") + "/keep/file1"));
}

TEST_F(SyncScenario, ReceiverRestartedMidTransferThenResyncedToCompletion) {
    const std::string big = sender_->SharePath("docs") + "/big.bin";
    WriteRandomFile(big, 48u << 20);
    GenerateFiles(sender_->SharePath("docs") + "/small", 10, 100, 8);
    // An older copy under the final name must stay whole until a complete one replaces it.
    MakeDirs(receiver_->SharePath("docs"));
    WriteFile(receiver_->SharePath("docs") + "/big.bin", "old complete copy");

    // A bandwidth limit (16 MiB/s) keeps the transfer slow enough for its partial file to be
    // seen; the sending rsync is then frozen so the receiver is stopped while the file is surely
    // half-way.
    auto sync = sender_->StartSync(kUser, {"docs"}, {"--compress", "--max-bandwidth", "16384"});
    ASSERT_TRUE(WaitFor([&] { return HasPartialFile(receiver_->SharePath("docs")); },
                        std::chrono::seconds(60)))
        << sync->Err();
    const pid_t rsync = SenderRsync(sync->Pid());
    ASSERT_GT(rsync, 0);
    kill(rsync, SIGSTOP);
    EXPECT_EQ(receiver_->Stop().status, 0);
    kill(rsync, SIGCONT);
    const int failed = sync->Wait();
    EXPECT_NE(failed, 0) << sync->Err();
    EXPECT_TRUE(failed == 9 || failed == 5) << failed << sync->Err();
    EXPECT_NE(sync->Err().find("not marked complete"), std::string::npos) << sync->Err();
    // No partial file under its final name.
    EXPECT_TRUE(ReadFile(receiver_->SharePath("docs") + "/big.bin") == "old complete copy");
    EXPECT_TRUE(ProcessesMentioning(big).empty());

    ASSERT_EQ(receiver_->Start().status, 0);
    const Result r = sender_->Sync(kUser, {"docs"}, {"--compress"});
    ASSERT_EQ(r.status, 0) << r.All();
    // The rerun leaves nothing of the interrupted one behind: the trees are equal, temporary
    // files included.
    ExpectSame("docs");
    EXPECT_FALSE(HasPartialFile(receiver_->SharePath("docs"), 0));
    EXPECT_NE(receiver_->Status().out.find("share: docs bound to SN-SENDER-A, last sync completed"),
              std::string::npos);
}

// An emptied folder would empty the receiver's copy: the share is refused, the other share still
// syncs, and only an explicit override lets the emptiness through. Empty folders and excluded
// files leave nothing to copy either.
TEST_F(SyncScenario, EmptiedFolderIsRefusedUnlessAllowed) {
    GenerateFiles(sender_->SharePath("docs"), 20, 100, 9);
    GenerateFiles(sender_->SharePath("media"), 2, 100, 10);
    Result r = sender_->Sync(kUser, {"docs", "media"});
    ASSERT_EQ(r.status, 0) << r.All();
    const auto full = Manifest(receiver_->SharePath("docs"));

    s2s_test::RemoveTree(sender_->SharePath("docs"));
    MakeDirs(sender_->SharePath("docs"));
    WriteFile(sender_->SharePath("media") + "/new", "new");
    r = sender_->Sync(kUser, {"docs", "media"}, {"--json"});
    EXPECT_EQ(r.status, 12) << r.All();
    MakeDirs(sender_->SharePath("docs") + "/#recycle/old");
    WriteFile(sender_->SharePath("docs") + "/.DS_Store", "x");
    EXPECT_EQ(sender_->Sync(kUser, {"docs"}, {"--exclude", ".DS_Store"}).status, 12);
    unlink((sender_->SharePath("docs") + "/.DS_Store").c_str());
    EXPECT_NE(r.out.find("\"guard\": \"empty-source\""), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("\"would_delete\": 20"), std::string::npos) << r.out;
    EXPECT_NE(r.err.find("--allow-empty-source"), std::string::npos) << r.err;
    EXPECT_EQ(Manifest(receiver_->SharePath("docs")), full);
    ExpectSame("media");
    EXPECT_NE(r.out.find("\"state\": \"refused\""), std::string::npos) << r.out;

    r = sender_->Sync(kUser, {"docs"}, {"--allow-empty-source"});
    ASSERT_EQ(r.status, 0) << r.All();
    ExpectSame("docs");
}

// A share registered on the receiver after it was started is served from the run's pairing on,
// even when it is the first share; a share the receiver does not serve is refused as such (not
// as a password fault) and the other shares still sync.
TEST_F(SyncScenario, LateShareSyncsAndAnUnservedShareIsRefusedAlone) {
    for (const char* share : {"late", "gone"}) {
        sender_->AddShare(share);
        GenerateFiles(sender_->SharePath(share), 3, 100, 12);
    }
    GenerateFiles(sender_->SharePath("docs"), 3, 100, 13);
    receiver_->AddShare("late");
    const Result r = sender_->Sync(kUser, {"late", "gone", "docs"}, {"--json"});
    EXPECT_NE(r.status, 0) << r.All();
    ExpectSame("late");
    ExpectSame("docs");
    EXPECT_NE(r.err.find("does not serve share 'gone' (is it registered there?)"),
              std::string::npos)
        << r.err;
    EXPECT_EQ(r.err.find("password"), std::string::npos) << r.err;
    EXPECT_NE(r.out.find("\"state\": \"refused\""), std::string::npos) << r.out;
}

// A cap on deletions stops a run before it deletes anything; a count and a percentage of the
// receiver's entries, hit and not hit.
TEST_F(SyncScenario, DeletionCapStopsTheRunBeforeItDeletes) {
    GenerateFiles(sender_->SharePath("docs"), 10, 100, 11);
    Result r = sender_->Sync(kUser, {"docs"}, {"--max-delete", "0"});
    ASSERT_EQ(r.status, 0) << r.All();
    for (const char* name : {"file1", "file2", "file3"}) {
        ASSERT_EQ(unlink((sender_->SharePath("docs") + "/" + name).c_str()), 0);
    }
    const auto before = Manifest(receiver_->SharePath("docs"));
    for (const char* cap : {"2", "29%"}) {
        r = sender_->Sync(kUser, {"docs"}, {"--max-delete", cap});
        EXPECT_EQ(r.status, 13) << cap << r.All();
        EXPECT_NE(r.err.find("would delete 3 entries of the receiver's 10"), std::string::npos)
            << r.err;
        EXPECT_EQ(Manifest(receiver_->SharePath("docs")), before) << cap;
    }
    EXPECT_EQ(sender_->Sync(kUser, {"docs"}, {"--max-delete", "20%%"}).status, 2);
    r = sender_->Sync(kUser, {"docs"}, {"--max-delete", "30%"});
    ASSERT_EQ(r.status, 0) << r.All();
    ExpectSame("docs");
}

// A volume that is a mount point and is not mounted leaves the bare mount point behind; whatever
// lies there is not the share and must not be mirrored.
TEST_F(SyncScenario, UnmountedVolumeIsRefused) {
    if (unshare(CLONE_NEWNS) != 0 ||
        mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
        GTEST_SKIP() << "needs a private mount namespace";
    }
    const std::string volume = sender_->Volume();
    const std::string disk = sender_->Root() + "/disk";
    MakeDirs(disk + "/docs");
    ASSERT_EQ(mount(disk.c_str(), volume.c_str(), nullptr, MS_BIND, nullptr), 0);
    struct Unmount {
        std::string path;
        ~Unmount() { umount2(path.c_str(), MNT_DETACH); }
    } unmount{volume};
    WriteFile(sender_->Root() + "/etc/s2s/host.conf",
              "[host]\n\tserial=\"SN-SENDER-A\"\n[volumes]\n\t" + volume + "=\"internal\"\n");
    GenerateFiles(sender_->SharePath("docs"), 5, 100, 12);
    Result r = sender_->Sync(kUser, {"docs"});
    ASSERT_EQ(r.status, 0) << r.All();
    const auto full = Manifest(receiver_->SharePath("docs"));

    ASSERT_EQ(umount(volume.c_str()), 0);
    WriteFile(sender_->SharePath("docs") + "/stray", "written while the volume was away");
    r = sender_->Sync(kUser, {"docs"}, {"--json", "--allow-empty-source"});
    EXPECT_EQ(r.status, 12) << r.All();
    EXPECT_NE(r.out.find("\"guard\": \"volume-not-mounted\""), std::string::npos) << r.out;
    EXPECT_EQ(Manifest(receiver_->SharePath("docs")), full);
}

}  // namespace
