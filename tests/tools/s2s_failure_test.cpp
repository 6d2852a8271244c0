// End-to-end scenarios of `s2s sync` that must fail, or cope, with a clear exit code and message:
// a second sender pairing a share that is taken, a sender without a client ID, an old server,
// Ctrl-C in the middle of a copy, a receiver that is down, a wrong password, an unsafe temporary
// directory and a full disk.
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>

#include "tools/s2s_scenario.h"

namespace {

using namespace s2s_scenario;
using s2s_test::WaitFor;

const char kUser[] = "backup";
const char kPassword[] = "correct horse battery";

class FailureScenario : public ::testing::Test {
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
    }

    void StartReceiver(bool oldServer = false) {
        ASSERT_EQ(receiver_->Configure(oldServer).status, 0);
        const Result started = receiver_->Start();
        ASSERT_EQ(started.status, 0) << started.All();
    }

    std::unique_ptr<Receiver> receiver_;
    std::unique_ptr<Sender> sender_;
};

TEST_F(FailureScenario, SecondSenderPairingATakenShareIsRefusedWithTheShareNamed) {
    StartReceiver();
    GenerateFiles(sender_->SharePath("docs"), 5, 100, 1);
    ASSERT_EQ(sender_->Sync(kUser, {"docs"}).status, 0);
    const auto before = Manifest(receiver_->SharePath("docs"));

    Sender second("second", "SN-SENDER-B", kPassword);
    second.AddShare("docs");
    second.AddShare("media");
    GenerateFiles(second.SharePath("docs"), 8, 300, 2);
    const Result r = second.Sync(kUser, {"media", "docs"}, {"--json"});
    EXPECT_EQ(r.status, 7) << r.All();
    EXPECT_NE(r.err.find("share 'docs' is already paired with another client"), std::string::npos)
        << r.err;
    EXPECT_NE(r.out.find("\"result\": \"conflict\""), std::string::npos) << r.out;
    // Nothing of the second sender arrived in the taken share.
    EXPECT_EQ(Manifest(receiver_->SharePath("docs")), before);
    EXPECT_NE(receiver_->Status().out.find("share: docs bound to SN-SENDER-A, last sync completed"),
              std::string::npos);

    // A sender with no serial number and no MAC address (only loopback here) has no client ID.
    Sender nameless("nameless", "", kPassword);
    nameless.AddShare("media");
    const Result n = nameless.Sync(kUser, {"media"});
    EXPECT_NE(n.status, 0);
    EXPECT_NE(n.err.find("no client ID could be found"), std::string::npos) << n.err;
    EXPECT_NE(n.err.find("set serial= under [host]"), std::string::npos) << n.err;
}

TEST_F(FailureScenario, OldServerIsSyncedWithoutMultiSourcePairing) {
    StartReceiver(/*oldServer=*/true);
    GenerateFiles(sender_->SharePath("docs") + "/d", 12, 500, 3);
    const Result r = sender_->Sync(kUser, {"docs"});
    ASSERT_EQ(r.status, 0) << r.All();
    EXPECT_NE(r.out.find("an old server"), std::string::npos) << r.out;
    EXPECT_EQ(Manifest(sender_->SharePath("docs")), Manifest(receiver_->SharePath("docs")));
}

TEST_F(FailureScenario, CtrlCStopsTheCopyLeavesNoRsyncAndNothingComplete) {
    StartReceiver();
    const std::string big = sender_->SharePath("docs") + "/big.bin";
    WriteRandomFile(big, 48u << 20);
    // Limited to 16 MiB/s, the copy cannot end before its partial file has been seen.
    auto sync = sender_->StartSync(kUser, {"docs", "media"},
                                   {"--compress", "--json", "--max-bandwidth", "16384"});
    ASSERT_TRUE(WaitFor([&] { return HasPartialFile(receiver_->SharePath("docs")); },
                        std::chrono::seconds(60)))
        << sync->Err();
    // Frozen, the sending rsync is surely still copying when the interrupt arrives; stopping the
    // run must not depend on its cooperation.
    const pid_t rsync = SenderRsync(sync->Pid());
    ASSERT_GT(rsync, 0);
    kill(rsync, SIGSTOP);
    sync->Signal(SIGINT);
    EXPECT_EQ(sync->Wait(), 130) << sync->Err();
    EXPECT_NE(sync->Err().find("stopped by Ctrl-C"), std::string::npos) << sync->Err();
    EXPECT_NE(sync->Out().find("\"state\": \"cancelled\""), std::string::npos) << sync->Out();
    EXPECT_NE(sync->Out().find("\"state\": \"not-run\""), std::string::npos) << sync->Out();
    // No rsync left running, on either side, for this transfer.
    EXPECT_TRUE(WaitFor([&] { return ProcessesMentioning(big).empty(); }));
    EXPECT_NE(kill(rsync, 0), 0);
    // The share was started but never finished: not complete on the server.
    const std::string status = receiver_->Status().out;
    EXPECT_EQ(status.find("last sync completed"), std::string::npos) << status;
}

TEST_F(FailureScenario, ReceiverDownIsReportedAsUnreachable) {
    StartReceiver();
    ASSERT_EQ(receiver_->Stop().status, 0);
    const Result r = sender_->Sync(kUser, {"docs"}, {"--json"});
    EXPECT_EQ(r.status, 5) << r.All();
    EXPECT_NE(r.err.find("the server did not answer: socket-io (10)"), std::string::npos) << r.err;
    EXPECT_NE(r.out.find("\"result\": \"unreachable\""), std::string::npos) << r.out;
    // What rsync said, in the tool's own plain words: no library log lines on the terminal.
    EXPECT_NE(r.err.find("Connection refused"), std::string::npos) << r.err;
    EXPECT_EQ(r.err.find("[ERROR]"), std::string::npos) << r.err;
}

// A temporary directory other users can write is refused, and a version query that fails for
// that reason stops the sync: it is never taken for an old server.
TEST_F(FailureScenario, UnsafeTemporaryDirectoryStopsTheSyncWithTheReason) {
    StartReceiver();
    ASSERT_EQ(chmod((sender_->Root() + "/tmp/S2S").c_str(), 0777), 0);
    const Result r = sender_->Sync(kUser, {"docs"});
    EXPECT_EQ(r.status, 1) << r.All();
    EXPECT_NE(r.err.find("protocol version could not be read"), std::string::npos) << r.err;
    EXPECT_NE(r.err.find("has mode 0777"), std::string::npos) << r.err;
    EXPECT_EQ(r.All().find("an old server"), std::string::npos) << r.All();
    EXPECT_EQ(receiver_->Status().out.find("client:"), std::string::npos);
}

// A full disk on the receiver: rsync's own words (which file, "No space left on device") reach
// the message and the JSON, not only the sender's rsync log.
TEST_F(FailureScenario, FullDiskOnTheReceiverIsNamedInTheMessageAndTheJson) {
    // A small file system on the receiver's share, in a mount namespace of this test's own (the
    // receiver's daemon, started afterwards, sees it; nothing outside does).
    if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr)) {
        GTEST_SKIP() << "needs a private mount namespace";
    }
    const std::string target = receiver_->SharePath("docs");
    ASSERT_EQ(mount("tmpfs", target.c_str(), "tmpfs", 0, "size=256k"), 0);
    struct Unmount {
        std::string path;
        ~Unmount() { umount2(path.c_str(), MNT_DETACH); }
    } unmount{target};
    StartReceiver();
    WriteRandomFile(sender_->SharePath("docs") + "/big.bin", 1u << 20);
    const Result r = sender_->Sync(kUser, {"docs"}, {"--json"});
    ASSERT_EQ(r.status, 9) << r.All();
    EXPECT_NE(r.err.find("No space left on device"), std::string::npos) << r.err;
    EXPECT_NE(r.out.find("\"rsync_errors\": ["), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("No space left on device"), std::string::npos) << r.out;
}

TEST_F(FailureScenario, WrongPasswordIsReportedAsAuthenticationFailure) {
    StartReceiver();
    Sender wrong("wrong", "SN-SENDER-A", "not the password");
    wrong.AddShare("docs");
    const Result r = wrong.Sync(kUser, {"docs"});
    EXPECT_EQ(r.status, 6) << r.All();
    EXPECT_NE(r.err.find("refused user 'backup' or its password"), std::string::npos) << r.err;
    // The password itself never appears in what the tool prints.
    EXPECT_EQ(r.All().find("not the password"), std::string::npos);
}

TEST_F(FailureScenario, PasswordFromTheEnvironmentIsAccepted) {
    StartReceiver();
    GenerateFiles(sender_->SharePath("docs"), 3, 10, 4);
    const Result r = sender_->Run(
        "s2s",
        {"sync", "--server-ip", "127.0.0.1", "--user", kUser, "--share", "docs", "--no-progress"},
        "", {{"S2S_PASSWORD", kPassword}});
    EXPECT_EQ(r.status, 0) << r.All();
}

}  // namespace
