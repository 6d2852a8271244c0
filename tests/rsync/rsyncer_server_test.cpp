// The Rsyncer against a real receiving server: an rsync daemon configured and started by
// s2s-receiver under its own S2S_ROOT, reached on 127.0.0.1 inside a private network namespace.
// Every operation runs for real: the version query (current and old server), pairing with and
// without conflicts, the 202 retry, data runs, an encrypted share, cancellation, a wrong
// password, a server that is down and the address loop.
#include <dirent.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <fstream>
#include <list>
#include <memory>
#include <random>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "gtest/gtest.h"
#include "rsync/child_process.h"
#include "rsync/rsyncer_fixture.h"
#include "s2s_host.h"
#include "s2s_rsyncer.h"

namespace {

using rsyncer_test::ClientHost;
using rsyncer_test::LogCapture;
using rsyncer_test::Receiver;
using rsyncer_test::ShareAttrs;
using rsyncer_test::Snapshot;
using Lines = std::list<std::string>;

const char kUser[] = "s2suser";
const char kPassword[] = "pw-Server-7f3a";

// Result codes of the wrapper and the receiver that these tests expect to see unchanged.
constexpr int kRsyncAuthOrModule = 5;
constexpr int kRsyncSocketIO = 10;
constexpr int kWrapperCancelled = 20;
constexpr int kReceiverPairedOther = 207;
constexpr int kReceiverNotPaired = 208;

// Incompressible bytes, reproducible from the seed.
void WriteBytes(const std::string& path, size_t size, unsigned seed) {
    std::mt19937_64 gen(seed);
    std::string data(size + 8, '\0');
    for (size_t at = 0; at < size; at += 8) {
        const uint64_t word = gen();
        std::memcpy(&data[at], &word, 8);
    }
    data.resize(size);
    s2s_test::WriteFile(path, data);
}

size_t CountEntries(const std::string& dir) {
    size_t n = 0;
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return 0;
    }
    while (struct dirent* e = readdir(d)) {
        if (std::string(e->d_name) != "." && std::string(e->d_name) != "..") {
            ++n;
        }
    }
    closedir(d);
    return n;
}

class RsyncerServer : public ::testing::Test {
  protected:
    void SetUp() override {
        if (!rsyncer_test::EnterPrivateNetwork()) {
            GTEST_SKIP() << "needs root for a private network namespace with the rsync port free";
        }
        client_.reset(new ClientHost("SN-CLIENT-A"));
        server_.reset(new Receiver(kUser, kPassword));
        for (const char* name : {"photos", "docs", "music"}) {
            client_->AddShare(name);
            server_->AddShare(name);
        }
        ShareAttrs encrypted;
        encrypted.encrypted = true;
        encrypted.keyLen = 32;
        client_->AddShare("secret", encrypted);
        server_->AddShare("secret", encrypted);
    }

    void StartServer(bool oldServer = false) {
        rsyncer_test::ToolResult r = server_->Configure(oldServer);
        ASSERT_EQ(r.status, 0) << r.output;
        r = server_->Start();
        ASSERT_EQ(r.status, 0) << r.output;
    }

    S2S::SyncInfo Info(const std::string& password = kPassword) const {
        S2S::SyncInfo info;
        info.SetServerIP("127.0.0.1");
        info.SetUser(kUser);
        info.SetPassword(password);
        return info;
    }

    // Nothing of a command may stay behind: neither the client's output files nor the server's
    // replies (which the daemon removes after the client has its answer, hence the wait).
    void ExpectNoLeftovers() const {
        EXPECT_EQ(CountEntries(client_->TempDir()), 0u);
        const std::string replies = server_->Root() + "/var/spool/s2s/replies";
        EXPECT_TRUE(s2s_test::WaitFor([&] { return CountEntries(replies) == 0; }))
            << CountEntries(replies) << " replies left in " << replies;
    }

    std::unique_ptr<ClientHost> client_;
    std::unique_ptr<Receiver> server_;
};

TEST_F(RsyncerServer, CurrentServerReportsItsVersion) {
    StartServer();
    LogCapture log;
    S2S::Rsyncer rsyncer;
    EXPECT_EQ(rsyncer.Initialize(Info()), 0);
    EXPECT_EQ(rsyncer.GetServerVersionValue(), 1);
    EXPECT_TRUE(rsyncer.SupportMultiSource());
    EXPECT_EQ(rsyncer.GetSyncInfo().GetServerIP(), "127.0.0.1");
    EXPECT_TRUE(log.Has("[INFO] s2s_rsyncer.cpp("));
    EXPECT_TRUE(log.Has("): Test 127.0.0.1 is reachable\n"));
    EXPECT_TRUE(log.Has("): Get server version [1]\n"));
    EXPECT_FALSE(log.Has("[ERROR] s2s_rsyncer.cpp("));
    ExpectNoLeftovers();

    // A failed query later leaves the known version as it was.
    ASSERT_EQ(server_->Stop().status, 0);
    rsyncer.GetServerVersion();
    EXPECT_TRUE(log.Has("): Fail to get server version [10]\n"));
    EXPECT_EQ(rsyncer.GetServerVersionValue(), 1);
}

// A version query that fails is no answer: taking it for an old server would pair the client as
// a whole and skip the multi-source conflict check. Initialize keeps its old rule; Connect fails.
TEST_F(RsyncerServer, FailedVersionQueryIsAFailureNotAnOldServer) {
    StartServer();
    ASSERT_EQ(chmod(client_->TempDir().c_str(), 0777), 0);  // refused: others could write there
    S2S::Rsyncer kept;
    EXPECT_EQ(kept.Initialize(Info()), 0);
    EXPECT_EQ(kept.GetServerVersionValue(), -1);
    S2S::Rsyncer rsyncer;
    EXPECT_EQ(rsyncer.Connect(Info()), S2S::kRsyncResultNoVersion);
    EXPECT_EQ(rsyncer.GetServerVersionValue(), -1);
    EXPECT_EQ(rsyncer.GetServerVersionResult(), 11);
    EXPECT_NE(rsyncer.GetLastError().find("has mode 0777"), std::string::npos)
        << rsyncer.GetLastError();
    ASSERT_EQ(chmod(client_->TempDir().c_str(), 0700), 0);
    EXPECT_EQ(rsyncer.Connect(Info()), 0);
    EXPECT_EQ(rsyncer.GetServerVersionValue(), 1);
    EXPECT_EQ(rsyncer.GetServerVersionResult(), 0);
}

// A stock rsync daemon without the command module: the wrapper answers 51, which the version
// query takes for an old server, while the connection test fails with it.
TEST_F(RsyncerServer, StockDaemonWithoutCommandsIsAnOldServer) {
    s2s_test::TempDir dir("s2s-rsyncer-stock");
    const std::string conf = dir / "rsyncd.conf";
    s2s_test::WriteFile(conf,
                        "port = 873\naddress = 127.0.0.1\nuse chroot = no\n"
                        "pid file = " +
                            dir / "pid" + "\n[data]\n\tpath = " + dir.path() + "\n");
    const pid_t daemon = fork();
    ASSERT_GE(daemon, 0);
    if (daemon == 0) {
        execl("/usr/bin/rsync", "rsync", "--daemon", "--no-detach", ("--config=" + conf).c_str(),
              static_cast<char*>(nullptr));
        _exit(127);
    }
    struct Reap {
        pid_t pid;
        ~Reap() {
            kill(pid, SIGTERM);
            waitpid(pid, nullptr, 0);
        }
    } reap{daemon};
    ASSERT_TRUE(s2s_test::WaitFor([] { return rsyncer_test::PortAccepting(873); }));

    LogCapture log;
    S2S::Rsyncer rsyncer;
    EXPECT_EQ(rsyncer.Initialize(Info()), S2S::kRsyncResultUnknownCmdAlt);
    EXPECT_TRUE(log.Has("): Fail to test connection [51]\n"));
    EXPECT_EQ(rsyncer.GetServerVersionValue(), -1);
    rsyncer.GetServerVersion();
    EXPECT_EQ(rsyncer.GetServerVersionValue(), 0);
    EXPECT_FALSE(log.Has("Fail to get server version"));
    EXPECT_EQ(CountEntries(client_->TempDir()), 0u);
}

TEST_F(RsyncerServer, OldServerIsVersionZeroAndPairsAsAWhole) {
    StartServer(/*oldServer=*/true);
    S2S::Rsyncer rsyncer;
    EXPECT_EQ(rsyncer.Initialize(Info()), 0);
    EXPECT_EQ(rsyncer.GetServerVersionValue(), 0);
    EXPECT_FALSE(rsyncer.SupportMultiSource());

    // An old server never reports conflicts: the list is cleared and the client pairs whole.
    Lines conflicts{"stale"};
    int result = -1;
    EXPECT_EQ(rsyncer.DoPairing(false, {"photos", "docs"}, conflicts, result), 0);
    EXPECT_EQ(result, 0);
    EXPECT_TRUE(conflicts.empty());
    EXPECT_NE(server_->Status().find("SN-CLIENT-A"), std::string::npos);

    // A second client is refused with 207, which a dry run still takes as a working connection.
    client_->WriteHostConf("SN-CLIENT-B");
    S2S::Rsyncer other;
    EXPECT_EQ(other.Initialize(Info()), 0);
    EXPECT_EQ(other.DoSinglePairing(false, result), 0);
    EXPECT_EQ(result, kReceiverPairedOther);
    EXPECT_EQ(other.TestProtocol(result), 0);
    EXPECT_EQ(result, 0);
    ExpectNoLeftovers();
}

TEST_F(RsyncerServer, MultiSourcePairingReportsConflictingShares) {
    StartServer();
    LogCapture log;
    {
        S2S::Rsyncer first;
        ASSERT_EQ(first.Initialize(Info()), 0);
        Lines conflicts;
        int result = -1;
        EXPECT_EQ(first.DoPairing(false, {"photos", "docs"}, conflicts, result), 0);
        EXPECT_EQ(result, 0);
        EXPECT_TRUE(conflicts.empty());
        // A share is bound to the client that completed a sync into it.
        for (const char* share : {"photos", "docs"}) {
            EXPECT_EQ(first.StartSyncShare(share, result), 0);
            EXPECT_EQ(result, 0);
            EXPECT_EQ(first.FinishSync("complete", share, result), 0);
            EXPECT_EQ(result, 0);
        }
    }

    client_->WriteHostConf("SN-CLIENT-B");
    S2S::Rsyncer second;
    ASSERT_EQ(second.Initialize(Info()), 0);
    Lines conflicts{"kept"};
    int result = -1;
    // 214 is a complete exchange: the conflicting shares are appended to the caller's list.
    EXPECT_EQ(second.DoPairing(true, {"music", "photos", "docs"}, conflicts, result), 0);
    EXPECT_EQ(result, S2S::kRsyncResultConflict);
    EXPECT_EQ(conflicts, (Lines{"kept", "photos", "docs"}));

    conflicts.clear();
    EXPECT_EQ(second.DoMultiPairing(false, {"music"}, conflicts, result), 0);
    EXPECT_EQ(result, 0);
    EXPECT_TRUE(conflicts.empty());

    // A share the server does not have: the server's code comes back unchanged, as -1 here.
    conflicts.clear();
    EXPECT_EQ(second.DoMultiPairing(false, {"bad/name"}, conflicts, result), -1);
    EXPECT_EQ(result, 204);
    EXPECT_TRUE(log.Has("): Fail to check share pairing [204]\n"));
    ExpectNoLeftovers();
}

TEST_F(RsyncerServer, AttributesRefusedWith202AreRetriedWithoutThem) {
    StartServer(/*oldServer=*/true);
    S2S::Rsyncer rsyncer;
    ASSERT_EQ(rsyncer.Initialize(Info()), 0);
    int result = -1;
    Lines conflicts;
    ASSERT_EQ(rsyncer.DoPairing(false, {"photos"}, conflicts, result), 0);
    ASSERT_EQ(result, 0);

    EXPECT_EQ(rsyncer.StartSyncShare("photos", true, result), 0);
    EXPECT_EQ(result, S2S::kRsyncResultRetryPlain);
    EXPECT_EQ(rsyncer.StartSyncShare("photos", false, result), 0);
    EXPECT_EQ(result, 0);
    result = -1;
    EXPECT_EQ(rsyncer.StartSyncShare("photos", result), 0);
    EXPECT_EQ(result, 0);
}

TEST_F(RsyncerServer, OtherAnswersAreNotRetried) {
    StartServer();
    S2S::Rsyncer rsyncer;
    ASSERT_EQ(rsyncer.Initialize(Info()), 0);
    // Not paired yet: the server's refusal is the result, with no second attempt.
    int result = -1;
    EXPECT_EQ(rsyncer.StartSyncShare("photos", result), 0);
    EXPECT_EQ(result, kReceiverNotPaired);
    EXPECT_EQ(rsyncer.FinishSync("complete", "photos", result), 0);
    EXPECT_EQ(result, kReceiverNotPaired);
    EXPECT_EQ(rsyncer.SendBeacon("nightly", result), 0);
    EXPECT_EQ(result, kReceiverNotPaired);
}

// A whole share syncs with what an administrator expects to survive: contents, permissions,
// owners, times, links, hard links, sparse and non-ASCII files; changes and deletions follow;
// exclude rules hold; a single path goes in relative mode to the same place.
TEST_F(RsyncerServer, DataRunsMirrorTheShare) {
    StartServer();
    const std::string src = client_->Volume() + "/photos";
    const std::string dst = server_->Volume() + "/photos";
    rsyncer_test::MakeDirs(src + "/album/2024");
    s2s_test::WriteFile(src + "/album/2024/a.txt", "first\n");
    s2s_test::WriteFile(src + "/readme", "hello");
    WriteBytes(src + "/album/big.bin", 3 * 1024 * 1024 + 17, 1);
    s2s_test::WriteFile(src + "/Übersicht – 日本語.txt", "non-ascii\n");
    ASSERT_EQ(symlink("album/2024/a.txt", (src + "/latest").c_str()), 0);
    ASSERT_EQ(link((src + "/readme").c_str(), (src + "/readme.hard").c_str()), 0);
    ASSERT_EQ(chown((src + "/readme").c_str(), 1234, 5678), 0);
    ASSERT_EQ(chmod((src + "/album/2024/a.txt").c_str(), 0640), 0);
    ASSERT_EQ(setxattr((src + "/readme").c_str(), "user.s2s", "tag", 3, 0), 0);
    {
        // 64 MiB with 4 KiB of data at the end: a hole that must stay one.
        std::ofstream sparse(src + "/sparse.img", std::ios::binary);
        sparse.seekp(64 * 1024 * 1024 - 4096);
        sparse << std::string(4096, 'x');
    }
    s2s_test::WriteFile(src + "/scratch.tmp", "never sent");
    // Stray content on the server is removed.
    s2s_test::WriteFile(dst + "/stray", "old");

    S2S::Rsyncer rsyncer;
    ASSERT_EQ(rsyncer.Initialize(Info()), 0);
    int lastProgress = -1;
    rsyncer.SetProgressCallback([&lastProgress](int percent) { lastProgress = percent; });
    int result = -1;
    Lines conflicts;
    ASSERT_EQ(rsyncer.DoPairing(false, {"photos"}, conflicts, result), 0);
    ASSERT_EQ(rsyncer.StartSyncShare("photos", result), 0);
    ASSERT_EQ(result, 0);
    ASSERT_EQ(rsyncer.RunSync(1, "photos", "/", {"*.tmp"}, result), 0);
    ASSERT_EQ(result, 0);
    EXPECT_GT(lastProgress, 0);
    EXPECT_LE(lastProgress, 100);

    auto expected = Snapshot(src);
    expected.erase("/scratch.tmp");
    EXPECT_EQ(Snapshot(dst), expected);
    char tag[8] = {0};
    EXPECT_EQ(getxattr((dst + "/readme").c_str(), "user.s2s", tag, sizeof tag), 3);
    EXPECT_STREQ(tag, "tag");
    struct stat st;
    ASSERT_EQ(stat((dst + "/sparse.img").c_str(), &st), 0);
    EXPECT_LT(st.st_blocks * 512, 1024 * 1024);

    // Change, add, delete; the next run follows.
    s2s_test::WriteFile(src + "/album/2024/a.txt", "second version\n");
    ASSERT_EQ(unlink((src + "/readme.hard").c_str()), 0);
    s2s_test::RemoveTree(src + "/album/2024");
    rsyncer_test::MakeDirs(src + "/album/2025");
    s2s_test::WriteFile(src + "/album/2025/b.txt", "new\n");
    ASSERT_EQ(rsyncer.RunSync(2, "photos", "/", {"*.tmp"}, result), 0);
    ASSERT_EQ(result, 0);
    expected = Snapshot(src);
    expected.erase("/scratch.tmp");
    EXPECT_EQ(Snapshot(dst), expected);

    // One path: recreated under the share on the server, nothing else touched.
    rsyncer_test::MakeDirs(src + "/inbox/deep");
    s2s_test::WriteFile(src + "/inbox/deep/one.txt", "one\n");
    s2s_test::WriteFile(src + "/readme", "changed but not sent");
    ASSERT_EQ(rsyncer.RunSync(3, "photos", "/inbox/deep/one.txt", {}, result), 0);
    ASSERT_EQ(result, 0);
    EXPECT_EQ(s2s_test::ReadFile(dst + "/inbox/deep/one.txt"), "one\n");
    EXPECT_EQ(s2s_test::ReadFile(dst + "/readme"), "hello");

    EXPECT_EQ(rsyncer.FinishSync("complete", "photos", result), 0);
    EXPECT_EQ(result, 0);
    EXPECT_EQ(rsyncer.SendBeacon("nightly", result), 0);
    EXPECT_EQ(result, 0);
    EXPECT_NE(server_->Status().find(", last sync completed"), std::string::npos)
        << server_->Status();
    ExpectNoLeftovers();
}

// An encrypted share travels as its ciphertext directory into the server's "@name@" module.
TEST_F(RsyncerServer, EncryptedShareSendsItsCiphertextDirectory) {
    StartServer();
    const std::string lower = client_->EncryptedDir("secret");
    WriteBytes(lower + "/ECRYPTFS_FNEK_ENCRYPTED.aaaa", 5000, 7);
    rsyncer_test::MakeDirs(lower + "/ECRYPTFS_FNEK_ENCRYPTED.dir");
    WriteBytes(lower + "/ECRYPTFS_FNEK_ENCRYPTED.dir/ECRYPTFS_FNEK_ENCRYPTED.bbbb", 9000, 8);
    s2s_test::WriteFile(client_->Volume() + "/secret/plain.txt", "cleartext never leaves");

    S2S::Rsyncer rsyncer;
    ASSERT_EQ(rsyncer.Initialize(Info()), 0);
    int result = -1;
    Lines conflicts;
    ASSERT_EQ(rsyncer.DoPairing(false, {"secret"}, conflicts, result), 0);
    ASSERT_EQ(rsyncer.StartSyncShare("secret", result), 0);
    ASSERT_EQ(result, 0);
    ASSERT_EQ(rsyncer.RunSync(1, "secret", "/", {}, result), 0);
    ASSERT_EQ(result, 0);
    EXPECT_EQ(Snapshot(server_->EncryptedDir("secret")), Snapshot(lower));
    EXPECT_EQ(CountEntries(server_->Volume() + "/secret"), 0u);
}

std::atomic<bool> g_cancel{false};
std::string g_partialDir;  // where the server's rsync writes its temporary file
int g_polls = 0;

// Cancels as soon as the server has begun writing the big file.
bool CancelWhenTransferStarted() {
    ++g_polls;
    if (!g_cancel) {
        DIR* d = opendir(g_partialDir.c_str());
        if (d != nullptr) {
            while (struct dirent* e = readdir(d)) {
                if (std::string(e->d_name).rfind(".big.bin.", 0) == 0) {
                    g_cancel = true;
                }
            }
            closedir(d);
        }
    }
    // On a fast machine the whole transfer can fit between two polls, so the run is stopped at the
    // latest at the first poll after rsync started (the wrapper polls right after the start).
    if (g_polls >= 1) {
        g_cancel = true;
    }
    return g_cancel;
}

// Our own children still alive (rsync or ssh left behind would show here).
size_t LiveChildren() {
    size_t n = 0;
    DIR* proc = opendir("/proc");
    const std::string self = std::to_string(getpid());
    while (struct dirent* e = readdir(proc)) {
        std::ifstream stat(std::string("/proc/") + e->d_name + "/stat");
        std::string line;
        if (!std::getline(stat, line)) {
            continue;
        }
        const size_t paren = line.rfind(')');
        if (paren == std::string::npos) {
            continue;
        }
        std::istringstream rest(line.substr(paren + 2));
        std::string state;
        std::string ppid;
        rest >> state >> ppid;
        if (ppid == self) {
            ++n;
        }
    }
    closedir(proc);
    return n;
}

TEST_F(RsyncerServer, CancellationStopsALargeTransfer) {
    StartServer();
    const std::string src = client_->Volume() + "/music";
    constexpr size_t kBig = 64 * 1024 * 1024;
    WriteBytes(src + "/big.bin", kBig, 3);
    g_cancel = false;
    g_polls = 0;
    g_partialDir = server_->Volume() + "/music";

    S2S::SyncInfo info = Info();
    info.SetCompression(true);  // incompressible data through -z keeps the transfer going
    S2S::Rsyncer rsyncer;
    ASSERT_EQ(rsyncer.Initialize(info), 0);
    int result = -1;
    Lines conflicts;
    ASSERT_EQ(rsyncer.DoPairing(false, {"music"}, conflicts, result), 0);
    rsyncer.SetCancelChecker(&CancelWhenTransferStarted);
    g_polls = 0;
    const auto start = std::chrono::steady_clock::now();
    ASSERT_EQ(rsyncer.RunSync(1, "music", "/", {}, result), 0);
    const auto took = std::chrono::steady_clock::now() - start;
    EXPECT_TRUE(g_cancel);
    EXPECT_EQ(result, kWrapperCancelled);
    EXPECT_LT(took, std::chrono::seconds(30));
    EXPECT_EQ(LiveChildren(), 0u);
    struct stat st;
    EXPECT_NE(stat((g_partialDir + "/big.bin").c_str(), &st), 0);

    // A later run without cancellation (and without the slow compression) completes the copy.
    S2S::Rsyncer again;
    ASSERT_EQ(again.Initialize(Info()), 0);
    ASSERT_EQ(again.RunSync(2, "music", "/", {}, result), 0);
    EXPECT_EQ(result, 0);
    ASSERT_EQ(stat((g_partialDir + "/big.bin").c_str(), &st), 0);
    EXPECT_EQ(static_cast<size_t>(st.st_size), kBig);
}

std::chrono::steady_clock::time_point g_limitedStart;
uint64_t g_limitedBytes = 0;
double g_limitedSeconds = 0;

// Watches a limited copy for two seconds: the bytes the server has written so far (its temporary
// file, or the file once complete) against the time since the run began.
bool StopLimitedCopyAfterTwoSeconds() {
    g_limitedSeconds =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - g_limitedStart).count();
    g_limitedBytes = 0;
    if (DIR* d = opendir(g_partialDir.c_str())) {
        while (struct dirent* e = readdir(d)) {
            struct stat st;
            if (std::string(e->d_name).find("big.bin") != std::string::npos &&
                stat((g_partialDir + "/" + e->d_name).c_str(), &st) == 0) {
                g_limitedBytes += static_cast<uint64_t>(st.st_size);
            }
        }
        closedir(d);
    }
    return g_limitedSeconds >= 2.0;
}

// The task's bandwidth limit holds: in two seconds at 256 KiB/s a copy moves about half a MiB,
// where an unlimited one over loopback finishes all 8 MiB. The bound is generous (twice the rate,
// plus 1 MiB for rsync's buffers) and only a limit that is ignored can break it.
TEST_F(RsyncerServer, BandwidthLimitSlowsTheCopy) {
    StartServer();
    constexpr uint64_t kSize = 8u << 20;
    WriteBytes(client_->Volume() + "/docs/big.bin", kSize, 5);
    g_partialDir = server_->Volume() + "/docs";
    S2S::SyncInfo info = Info();
    info.SetMaxBandwidth(256);
    S2S::Rsyncer rsyncer;
    ASSERT_EQ(rsyncer.Initialize(info), 0);
    int result = -1;
    Lines conflicts;
    ASSERT_EQ(rsyncer.DoPairing(false, {"docs"}, conflicts, result), 0);
    rsyncer.SetCancelChecker(&StopLimitedCopyAfterTwoSeconds);
    g_limitedStart = std::chrono::steady_clock::now();
    ASSERT_EQ(rsyncer.RunSync(1, "docs", "/", {}, result), 0);
    EXPECT_EQ(result, kWrapperCancelled);
    const double bound = 2.0 * 256 * 1024 * g_limitedSeconds + (1u << 20);
    EXPECT_LT(static_cast<double>(g_limitedBytes), bound)
        << g_limitedBytes << " bytes in " << g_limitedSeconds << " s";
    EXPECT_LT(g_limitedBytes, kSize);
}

// The command lines of the rsync runs: an "rsync" first on PATH records its arguments (one run a
// line, each argument ended by \x1f) and hands over to the real program. Reading /proc from the
// cancel checker instead missed runs that ended before the first look.
std::string g_argvLog;

std::vector<std::vector<std::string>> Argvs() {
    std::vector<std::vector<std::string>> runs;
    std::istringstream in(s2s_test::ReadFile(g_argvLog));
    for (std::string line; std::getline(in, line);) {
        std::vector<std::string> args;
        for (size_t start = 0; start < line.size();) {
            const size_t end = line.find('\x1f', start);
            args.push_back(line.substr(start, end - start));
            start = end == std::string::npos ? line.size() : end + 1;
        }
        runs.push_back(args);
    }
    return runs;
}

void ClearArgvs() {
    s2s_test::WriteFile(g_argvLog, "");
}

// Puts the recording rsync first on PATH for the object's lifetime.
class RecordingRsync {
  public:
    RecordingRsync() {
        const std::string real = S2S::rsync_internal::FindProgram("rsync");
        g_argvLog = dir_ / "argv.log";
        const std::string shim = dir_ / "rsync";
        s2s_test::WriteFile(
            shim, "#!/bin/sh\nfor a in \"$@\"; do printf '%s\\037' \"$a\"; done >>'" + g_argvLog +
                      "'\necho >>'" + g_argvLog + "'\nexec '" + real + "' \"$@\"\n");
        chmod(shim.c_str(), 0755);
        const char* old = std::getenv("PATH");
        path_.reset(new s2s_test::ScopedEnv(
            "PATH", (dir_.path() + ":" + (old != nullptr ? old : "/usr/bin:/bin")).c_str()));
        ClearArgvs();
    }

  private:
    s2s_test::TempDir dir_{"s2s-rsync-shim"};
    std::unique_ptr<s2s_test::ScopedEnv> path_;
};

// The cancel checker every run polls; runs are recorded by the shim above.
bool RecordRsyncArgv() {
    return false;
}

bool Contains(const std::vector<std::string>& args, const std::string& arg) {
    return std::find(args.begin(), args.end(), arg) != args.end();
}

bool HasPrefix(const std::vector<std::string>& args, const std::string& prefix) {
    for (const auto& a : args) {
        if (a.rfind(prefix, 0) == 0) {
            return true;
        }
    }
    return false;
}

// What each kind of run hands to rsync: the command time-out and the transfer time-out, the
// options every run has, the debug log of real tasks only, the daemon port kept without SSH,
// the source paths of RunSync and the share's module as destination.
TEST_F(RsyncerServer, RunsCarryTheirOptions) {
    StartServer();
    RecordingRsync recording;
    const std::string src = client_->Volume() + "/photos";
    rsyncer_test::MakeDirs(src + "/a");
    s2s_test::WriteFile(src + "/a/b", "b");

    S2S::SyncInfo info = Info();
    info.SetSSHPort(2222);  // not used: the task does not use SSH
    info.SetCompression(true);
    info.SetMaxBandwidth(300);  // KiB per second, for data runs only
    S2S::Rsyncer rsyncer;
    rsyncer.SetCancelChecker(&RecordRsyncArgv);
    ASSERT_EQ(rsyncer.Initialize(info), 0);
    ASSERT_EQ(Argvs().size(), 2u);  // the dry-run pairing and the version query
    for (const auto& args : Argvs()) {
        EXPECT_TRUE(Contains(args, "--timeout=60"));
        EXPECT_FALSE(HasPrefix(args, "--rsh"));
        EXPECT_FALSE(HasPrefix(args, "--log-file"));
        EXPECT_FALSE(HasPrefix(args, "--bwlimit"));
        EXPECT_TRUE(HasPrefix(args, "rsync://s2suser@127.0.0.1/@s2s-cmd/")) << args.back();
        EXPECT_FALSE(HasPrefix(args, "rsync://s2suser@127.0.0.1:"));
    }

    int result = -1;
    Lines conflicts;
    ASSERT_EQ(rsyncer.DoPairing(false, {"photos"}, conflicts, result), 0);
    ClearArgvs();
    ASSERT_EQ(rsyncer.RunSync(1, "photos", "/", {"*.tmp", "cache/"}, result), 0);
    ASSERT_EQ(result, 0);
    ASSERT_EQ(Argvs().size(), 1u);
    std::vector<std::string> args = Argvs()[0];
    for (const char* expected :
         {"--timeout=600", "--delete", "--numeric-ids", "--compress", "--whole-file", "--acls",
          "--exclude=*.tmp", "--exclude=cache/", "--bwlimit=300"}) {
        EXPECT_TRUE(Contains(args, expected)) << expected;
    }
    EXPECT_TRUE(Contains(args, "--log-file=" + client_->Root() + "/var/log/s2s_rsync.log"));
    EXPECT_FALSE(Contains(args, "--relative"));
    ASSERT_GE(args.size(), 2u);
    EXPECT_EQ(args[args.size() - 2], src + "/");
    EXPECT_EQ(args.back(), "rsync://s2suser@127.0.0.1/photos");

    // A path inside the share: relative mode from the "/." anchor; block-level sync is delta.
    info.SetCompression(false);
    info.SetBlockLevelSync(true);
    info.SetMaxBandwidth(0);  // no limit
    S2S::Rsyncer delta;
    ASSERT_EQ(delta.Initialize(info), 0);
    delta.SetCancelChecker(&RecordRsyncArgv);
    ClearArgvs();
    ASSERT_EQ(delta.RunSync(2, "photos", "/a/b", {}, result), 0);
    ASSERT_EQ(result, 0);
    ASSERT_EQ(Argvs().size(), 1u);
    args = Argvs()[0];
    EXPECT_TRUE(Contains(args, "--relative"));
    EXPECT_TRUE(Contains(args, "--no-whole-file"));
    EXPECT_FALSE(HasPrefix(args, "--bwlimit"));
    EXPECT_FALSE(Contains(args, "--compress"));
    EXPECT_EQ(args[args.size() - 2], src + "/./a/b");
    EXPECT_EQ(args.back(), "rsync://s2suser@127.0.0.1/photos");

    // A test task runs without the debug log; with SSH the task's SSH port goes to ssh.
    S2S::Rsyncer::RsyncTask quiet;
    ASSERT_EQ(delta.InitRsyncTask(quiet, true), 0);
    ClearArgvs();
    EXPECT_EQ(quiet.Execute(src + "/", "photos", &RecordRsyncArgv, "", {}), 0);
    ASSERT_EQ(Argvs().size(), 1u);
    EXPECT_FALSE(HasPrefix(Argvs()[0], "--log-file"));
    EXPECT_TRUE(Contains(Argvs()[0], "--timeout=600"));

    info.SetSSH(true);
    S2S::Rsyncer overSsh;
    overSsh.Initialize(info);  // no sshd here: only the command line matters
    S2S::Rsyncer::RsyncTask sshTask;
    ASSERT_EQ(overSsh.InitRsyncTask(sshTask, false), 0);
    ClearArgvs();
    EXPECT_NE(
        sshTask.ExecuteCmd({"command=\"S2S_UpdateTaskStatus\"", "clientID=\"x\"", "taskName=\"t\""},
                           &RecordRsyncArgv),
        0);
    ASSERT_EQ(Argvs().size(), 1u);
    EXPECT_TRUE(HasPrefix(Argvs()[0], "--rsh=sshpass -e ssh -p 2222 "));
    EXPECT_FALSE(HasPrefix(Argvs()[0], "--log-file"));
    EXPECT_TRUE(Contains(Argvs()[0], "--timeout=60"));
    const std::vector<std::string> sshArgs = Argvs()[0];
    for (const auto& a : sshArgs) {
        EXPECT_EQ(a.find(kPassword), std::string::npos) << a;
    }
    EXPECT_EQ(LiveChildren(), 0u);
}

TEST_F(RsyncerServer, WrongPasswordFailsTheServerTest) {
    StartServer();
    LogCapture log;
    S2S::Rsyncer rsyncer;
    EXPECT_EQ(rsyncer.Initialize(Info("not-the-password")), kRsyncAuthOrModule);
    EXPECT_EQ(rsyncer.GetServerVersionValue(), -1);
    EXPECT_TRUE(log.Has("): Fail to test connection [5]\n"));
    EXPECT_TRUE(log.Has("): Fail to find rsync reachable ip for (127.0.0.1)\n"));
    EXPECT_FALSE(log.Has("not-the-password"));
    ExpectNoLeftovers();
}

TEST_F(RsyncerServer, ServerDownLeavesTheLastCode) {
    StartServer();
    ASSERT_EQ(server_->Stop().status, 0);
    LogCapture log;
    S2S::Rsyncer rsyncer;
    EXPECT_EQ(rsyncer.Initialize(Info()), kRsyncSocketIO);
    EXPECT_TRUE(log.Has("): Fail to test connection [10]\n"));
    EXPECT_EQ(rsyncer.GetServerVersionValue(), -1);

    // Each command reports the same code; none becomes -1.
    int result = -1;
    EXPECT_EQ(rsyncer.SendBeacon("nightly", result), 0);
    EXPECT_EQ(result, kRsyncSocketIO);
    rsyncer.GetServerVersion();
    EXPECT_TRUE(log.Has("): Fail to get server version [10]\n"));
    EXPECT_EQ(rsyncer.GetServerVersionValue(), -1);
    ExpectNoLeftovers();
}

// TestServer walks the usable addresses in order: the given IP first, then the name's; the first
// that answers both the connection test and the version query wins and stays in the SyncInfo.
TEST_F(RsyncerServer, AddressLoopSettlesOnTheFirstAnsweringAddress) {
    StartServer();
    LogCapture log;
    S2S::SyncInfo info = Info();
    info.SetServerIP("127.0.0.2");  // nothing listens there
    info.SetServerName("localhost");
    S2S::Rsyncer rsyncer;
    EXPECT_EQ(rsyncer.Initialize(info), 0);
    EXPECT_EQ(rsyncer.GetSyncInfo().GetServerIP(), "127.0.0.1");
    const std::string text = log.Text();
    const size_t first = text.find("): Test 127.0.0.2 is reachable\n");
    const size_t second = text.find("): Test 127.0.0.1 is reachable\n");
    ASSERT_NE(first, std::string::npos);
    ASSERT_NE(second, std::string::npos);
    EXPECT_LT(first, second);
    EXPECT_TRUE(log.Has("): Fail to test connection [10]\n"));

    // With every address failing the last code comes back and the last address stays.
    ASSERT_EQ(server_->Stop().status, 0);
    S2S::Rsyncer down;
    EXPECT_EQ(down.Initialize(info), kRsyncSocketIO);
    EXPECT_EQ(down.GetSyncInfo().GetServerIP(), "127.0.0.1");
    EXPECT_TRUE(log.Has("): Fail to find rsync reachable ip for localhost(127.0.0.1)\n"));

    // A version learnt before still lets a later initialisation succeed.
    EXPECT_EQ(rsyncer.Initialize(info), 0);
}

}  // namespace
