// RsyncWrapper, the sending side's one rsync run: through a stand-in rsync, the argument lists it
// hands over (one golden table), what it makes of how rsync ended, cancel and leftovers, the
// debug log's rotation; against the receiver's daemon from ServerPair on a free loopback port,
// what a data run keeps, the key module, the result code of every failure it decides, progress,
// and the command transport.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <random>
#include <regex>
#include <thread>

#include "gtest/gtest.h"
#include "rsync/child_process.h"
#include "s2s_rsync_wrapper.h"
#include "support/server_pair.h"
#include "support/tree_manifest.h"

namespace {

using VURN::Backup::RsyncWrapper;
using namespace s2s_test;
namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

const boost::function<bool()> kNoCancel;
const char kPassword[] = "pw-Wrapper-5d1e";
// rsync's daemon reads "user:password" lines of at most 1023 bytes: the real runs use the longest
// password that fits with their user "s2suser".
const std::string kLongest(1015, 'p');

void WriteRandom(const std::string& path, size_t size, unsigned seed) {
    std::mt19937 gen(seed);
    std::string data(size, '\0');
    std::generate(data.begin(), data.end(), [&] { return static_cast<char>(gen()); });
    WriteFile(path, data);
}

void WriteSparse(const std::string& path, off_t size) {
    const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    EXPECT_EQ(pwrite(fd, "head", 4, 0) + pwrite(fd, "tail", 4, size - 4), 8);
    close(fd);
}

// Live processes whose command line holds `needle` (zombies have none).
int ProcessesMentioning(const std::string& needle) {
    return std::atoi(RunProgram({"/usr/bin/pgrep", "-c", "-f", "--", needle}).out.c_str());
}

class StandIn : public ::testing::Test {
  protected:
    // A wrapper whose rsync is the shell script `script`, aimed at a daemon that is never reached.
    std::unique_ptr<RsyncWrapper> Wrapper(const std::string& script) {
        WriteFile(dir_ / "rsync", "#!/bin/sh\n" + script + "\n");
        chmod((dir_ / "rsync").c_str(), 0755);
        WriteFile(dir_ / "f", "x");
        auto w = std::make_unique<RsyncWrapper>();
        w->setRsyncPath(dir_ / "rsync");
        w->setSrcPath(dir_ / "f");
        w->setPort(8873);
        w->setVurnAuth(true, true);
        w->setDestPath("127.0.0.1", "u", kPassword, "photos", "");
        return w;
    }
    TempDir dir_{"s2s-standin"};
};

// Each row configures a wrapper; the stand-in records the arguments. {dir} stands for the test's
// folder, {cmd} for a command's temporary folder, {token} for its reply token.
TEST_F(StandIn, GoldenArgumentLists) {
    const std::string src = dir_ / "src", sparse = dir_ / "sparse", log = dir_ / "argv";
    fs::create_directories(src);
    fs::create_directories(sparse + "/a/b");
    WriteFile(sparse + "/a/empty", "");  // looks short of blocks, has no hole
    WriteSparse(sparse + "/a/b/disk.img", 8 << 20);
    const std::string base = "--recursive --links --perms --times --modify-window=-1 --hard-links ";
    const std::string daemon = " --contimeout=30 --sockopts=TCP_NODELAY";
    const std::string push = daemon + " -- {dir}/src/ rsync://u@127.0.0.1:8873/photos";
    const std::string ssh = " -o ConnectTimeout=30 -o StrictHostKeyChecking=accept-new";
    const std::string overSsh =
        " --rsync-path=rsync --config=/srv/rsyncd.conf -- {dir}/src/ "
        "rsync://u@127.0.0.1/photos";
    const struct Row {
        const char* name;
        std::function<void(RsyncWrapper&)> set;
        std::string argv;
    } rows[] = {
        {"plain push", [](RsyncWrapper&) {}, base + "--no-whole-file" + push},
        {"every task option",
         [&](RsyncWrapper& w) {
             w.setDelete(true), w.setMaxDelete(3), w.setNumericIds(true);
             w.setVurnPseudoRoot(true), w.setCompress(true), w.setTimeout(600);
             w.setExcludeRule({"*.tmp", "/cache/"}), w.setRelativePath(true), w.setVurnAcl(true);
             w.setBandwidthLimit(300), w.setDebugLog(true), w.setLogFile(dir_ / "rsync.log");
             w.setProgressCallback([](int) {});
             w.setDryRun([](const std::string&, const std::string&) {});
         },
         base +
             "--owner --group --devices --specials --numeric-ids --delete --max-delete=3 "
             "--dry-run --itemize-changes --itemize-changes --out-format=s2s-item:%i %n --compress "
             "--no-whole-file --relative --acls --xattrs --log-file={dir}/rsync.log "
             "--bwlimit=300 --info=progress2 --timeout=600" +
             daemon +
             " --exclude=*.tmp --exclude=/cache/ -- {dir}/src/ rsync://u@127.0.0.1:8873/photos"},
        {"holes in the tree", [&](RsyncWrapper& w) { w.setSrcPath(sparse + "/"); },
         base + "--sparse --no-whole-file" + daemon +
             " -- {dir}/sparse/ rsync://u@127.0.0.1:8873/photos"},
        {"list only, paths from a list",
         [&](RsyncWrapper& w) { w.setListOnly(true), w.setFilesFrom(dir_ / "list"); },
         base +
             "--files-from={dir}/list --from0 --delete-missing-args --no-whole-file --list-only" +
             push},
        {"over ssh",
         [&](RsyncWrapper& w) {
             w.setSsh(true), w.setPort(2222), w.setSshKnownHostsFile(dir_ / "known");
             w.setRemoteConfig("/srv/rsyncd.conf");
         },
         base + "--no-whole-file --rsh=sshpass -e ssh -p 2222" + ssh +
             " -o UserKnownHostsFile={dir}/known -o PubkeyAuthentication=no -l u" + overSsh},
        {"over ssh with a key, to the key module",
         [&](RsyncWrapper& w) {
             w.setSsh(true), w.setSshIdentityFile(dir_ / "id"),
                 w.setRemoteConfig("/srv/rsyncd.conf");
             w.setDestPath("127.0.0.1", "u", kPassword, "/usr/vurn/etc/.encrypt", "vault");
         },
         base + "--no-whole-file --rsh=ssh -p 8873" + ssh + " -i {dir}/id -o BatchMode=yes -l u" +
             " --rsync-path=rsync --config=/srv/rsyncd.conf -- {dir}/src/ "
             "rsync://u@127.0.0.1/@s2s-key/vault/"},
        {"command",
         [](RsyncWrapper& w) {
             w.setDestPath("127.0.0.1", "u", kPassword, "", "");
             w.setVurnCustCmdRule({"command=\"S2S_GetProtocolVer\"", "clientID=\"x\""});
         },
         "--recursive --max-size=1048576 --early-input={cmd}/command" + daemon +
             " -- rsync://u@127.0.0.1:8873/@s2s-cmd/{token}/ {cmd}/reply/"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        auto w = Wrapper("for a in \"$@\"; do printf '%s ' \"$a\"; done > '" + log + "'");
        w->setSrcPath(src + "/");
        row.set(*w);
        w->execute(kNoCancel);
        std::string got = ReadFile(log);
        EXPECT_EQ(got.find(kPassword), std::string::npos) << "the password is on a command line";
        got = std::regex_replace(got, std::regex(dir_.path()), "{dir}");
        got = std::regex_replace(got, std::regex("/[^ ]*/s2s-cmd\\.[A-Za-z0-9]{6}"), "{cmd}");
        got = std::regex_replace(got, std::regex("/[0-9a-f]{32}/"), "/{token}/");
        EXPECT_EQ(got, row.argv + " ");
    }
}

// rsync's exit code is the run's; a death by signal reads as cancelled; an exec failing in the
// child (127) is 14.
TEST_F(StandIn, ExitCodesAndSignals) {
    const std::pair<const char*, int> rows[] = {
        {"exit 0", 0},
        {"echo 'rsync: some files vanished' >&2; exit 23", 23},
        {"kill -TERM $$", RsyncWrapper::kResultCancelled},
        {"exit 127", RsyncWrapper::kResultSpawn}};
    for (const auto& [script, expected] : rows) {
        EXPECT_EQ(Wrapper(script)->execute(kNoCancel), expected) << script;
    }
}

// A run returns when rsync ends, not when a process it left behind closes the output or a poll
// interval (100 ms) runs out; what it left behind goes with it.
TEST_F(StandIn, ReturnsWhenRsyncEndsAndLeavesNothingBehind) {
    const std::string marker = "s2s-child-left-" + std::to_string(getpid());
    double fastest = 1e9;
    for (int i = 0; i < 3; ++i) {
        auto w = Wrapper("sh -c 'sleep 30' " + marker + " & echo started; exit 3");
        const auto start = Clock::now();
        EXPECT_EQ(w->execute([] { return false; }), 3);
        fastest = std::min(fastest,
                           std::chrono::duration<double, std::milli>(Clock::now() - start).count());
    }
    EXPECT_LT(fastest, 70.0);
    EXPECT_TRUE(WaitFor([&] { return ProcessesMentioning(marker) == 0; }))
        << "a process of the run outlived it";
}

// Cancelling ends the whole process group, even a part that ignores SIGTERM (SIGKILL follows
// after a grace period of 3 s).
TEST_F(StandIn, CancelEndsTheWholeGroup) {
    const std::string marker = "s2s-cancel-left-" + std::to_string(getpid());
    auto w = Wrapper("trap '' TERM; sh -c 'sleep 30' " + marker + " & wait");
    const auto start = Clock::now();
    EXPECT_EQ(w->execute([&] { return ProcessesMentioning(marker) > 0; }),
              RsyncWrapper::kResultCancelled);
    EXPECT_LT(Clock::now() - start, std::chrono::seconds(8));
    EXPECT_EQ(ProcessesMentioning(marker), 0) << "a process of the group survived";
}

// A command's rsync left to end after its reply was taken: a failed end is still logged.
TEST_F(StandIn, ACommandRsyncFailingAfterItsReplyIsLogged) {
    const std::string go = dir_ / "go";
    auto w = Wrapper(
        "for a; do reply=$a; done; echo 7 > \"${reply}t\"; mv \"${reply}t\" "
        "\"${reply}result\"; while [ ! -e '" +
        go + "' ]; do sleep 0.01; done; exit 23");
    w->setVurnCustCmdRule({"command=\"S2S_GetProtocolVer\"", "clientID=\"abc\""});
    LogCapture log(S2S::Logger::Warning);
    {
        S2S::rsync_internal::LeftRunsScope scope;
        EXPECT_EQ(w->execute(kNoCancel), 7);  // the reply, while the stand-in still runs
        WriteFile(go, "");
    }
    EXPECT_TRUE(log.Contains("rsync_wrapper.cpp(")) << log.Text();
    EXPECT_TRUE(log.Contains("): the command's rsync ended with code 23 after its reply\n"))
        << log.Text();
}

// A full debug log is moved aside before the next run; only the newest old logs are kept.
TEST_F(StandIn, FullDebugLogIsRotated) {
    const std::string log = dir_ / "rsync.log";
    WriteFile(log + ".1", "older");
    WriteFile(log + ".3", "oldest");
    WriteFile(log, "full log\n");
    ASSERT_EQ(truncate(log.c_str(), RsyncWrapper::kLogRotateBytes), 0);
    auto w = Wrapper("exit 0");
    w->setDebugLog(true);
    w->setLogFile(log);
    ASSERT_EQ(w->execute(kNoCancel), 0);
    EXPECT_FALSE(fs::exists(log));
    EXPECT_EQ(ReadFile(log + ".1").compare(0, 9, "full log\n"), 0);
    EXPECT_EQ(ReadFile(log + ".2"), "older");
    EXPECT_FALSE(fs::exists(log + ".4"));
}

class WrapperRun : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        if (geteuid() != 0) {
            return;  // the receiver's daemon needs root (chroot, ownership)
        }
        pair_ = std::make_unique<ServerPair>(PairOptions{"s2suser", kLongest});
        pair_->Receiver().AddShare("photos");
        pair_->Receiver().AddShare("vault", ShareAttrs{true});
        why_ = pair_->Start();
    }
    static void TearDownTestSuite() { pair_.reset(); }
    void SetUp() override {
        if (!pair_) {
            GTEST_SKIP() << "the receiver's daemon needs root";
        }
        ASSERT_EQ(why_, "");
    }
    static void Aim(RsyncWrapper& w, const std::string& dest, const std::string& module = "") {
        w.setPort(pair_->Port());
        w.setConnectTimeout(10);
        w.setVurnAuth(true, true);
        w.setDestPath("127.0.0.1", "s2suser", kLongest, dest, module);
    }
    static int Command(const std::list<std::string>& lines, const std::string& module = "") {
        RsyncWrapper w;
        Aim(w, "");
        w.setCommandModule(module.empty() ? "@s2s-cmd" : module);
        w.setVurnCustCmdRule(lines);
        return w.execute(kNoCancel);
    }
    // The daemon removes a reply after its client has gone, so the spool empties shortly after.
    static void ExpectCleanSpool() {
        EXPECT_TRUE(WaitFor([&] {
            return fs::is_empty(pair_->Receiver().Spool() + "/replies") &&
                   fs::is_empty(pair_->Receiver().Spool() + "/conns");
        })) << "replies left in the spool";
    }
    static std::unique_ptr<ServerPair> pair_;
    static std::string why_;
    TempDir local_{"s2s-wrapper-src"};
    std::string src_ = local_ / "share";
    std::string dst_ = pair_ ? pair_->Receiver().SharePath("photos") : "";
};
std::unique_ptr<ServerPair> WrapperRun::pair_;
std::string WrapperRun::why_;

// What an administrator expects a copy to keep: content, owners, permissions, times to the
// nanosecond (a file rewritten with the same size within the second of the last run is still
// sent), links, hard links, holes, extended attributes, non-ASCII names; changes and deletions
// follow, excluded paths stay untouched on both sides, and the deletion limit ends the run with 25.
TEST_F(WrapperRun, DataRunsMirrorTheTreeWithItsMetadata) {
    fs::create_directories(src_ + "/sub/deeper");
    fs::create_directories(src_ + "/cache");
    WriteFile(src_ + "/plain.txt", "hello\n");
    WriteFile(src_ + "/sub/Ünïcødé ファイル.txt", "non-ascii\n");
    ASSERT_EQ(chown((src_ + "/plain.txt").c_str(), 1234, 5678), 0);
    ASSERT_EQ(chmod((src_ + "/plain.txt").c_str(), 0640), 0);
    ASSERT_EQ(setxattr((src_ + "/plain.txt").c_str(), "user.s2s", "tag", 3, 0), 0);
    WriteFile(src_ + "/sub/deeper/exec.sh", "#!/bin/sh\n");
    ASSERT_EQ(chmod((src_ + "/sub/deeper/exec.sh").c_str(), 0751), 0);
    ASSERT_EQ(symlink("../plain.txt", (src_ + "/sub/link").c_str()), 0);
    ASSERT_EQ(symlink("/nowhere/absolute", (src_ + "/dangling").c_str()), 0);
    ASSERT_EQ(link((src_ + "/plain.txt").c_str(), (src_ + "/hard.txt").c_str()), 0);
    WriteRandom(src_ + "/random.bin", 1 << 20, 1);
    WriteSparse(src_ + "/sparse.img", 16 << 20);
    WriteFile(src_ + "/skip.tmp", "excluded\n");
    WriteFile(src_ + "/cache/x", "excluded\n");
    const auto setTime = [](const std::string& path, long nsec) {
        const struct timespec times[2] = {{1600000000, nsec}, {1600000000, nsec}};
        ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW), 0) << path;
    };
    setTime(src_ + "/plain.txt", 100000000);
    const auto run = [&](long long maxDelete) {
        RsyncWrapper w;
        w.setMaxDelete(maxDelete), w.setDelete(true), w.setNumericIds(true);
        w.setVurnPseudoRoot(true), w.setVurnAcl(true), w.setExcludeRule({"*.tmp", "/cache/"});
        w.setSrcPath(src_ + "/");
        Aim(w, "photos");
        const int rc = w.execute(kNoCancel);
        return std::to_string(rc) + " " + w.lastError();
    };
    const auto expected = [&] {
        auto tree = TreeManifest(src_);
        tree.erase("/skip.tmp"), tree.erase("/cache"), tree.erase("/cache/x");
        return tree;
    };
    ASSERT_EQ(run(-1), "0 ");
    EXPECT_EQ(TreeManifest(dst_), expected());
    char tag[8] = {0};
    EXPECT_EQ(getxattr((dst_ + "/plain.txt").c_str(), "user.s2s", tag, sizeof tag), 3);
    struct stat st;
    ASSERT_EQ(stat((dst_ + "/sparse.img").c_str(), &st), 0);
    EXPECT_LT(st.st_blocks * 512, 1 << 20) << "the sparse file arrived filled";
    // Same size, same second, other nanoseconds; a deletion, a removed folder, a new file.
    WriteFile(src_ + "/plain.txt", "HELLO\n");
    setTime(src_ + "/plain.txt", 900000000);
    ASSERT_EQ(unlink((src_ + "/sub/link").c_str()), 0);
    fs::remove_all(src_ + "/sub/deeper");
    WriteFile(src_ + "/new.txt", "new\n");
    WriteFile(dst_ + "/keep.tmp", "server-side, excluded\n");
    ASSERT_EQ(run(-1), "0 ");
    auto got = TreeManifest(dst_);
    EXPECT_EQ(got.erase("/keep.tmp"), 1u);
    EXPECT_EQ(got, expected());
    // The daemon ends a push whose deletions the limit stopped with 0: the run still says 25.
    ASSERT_EQ(unlink((src_ + "/new.txt").c_str()), 0);
    ASSERT_EQ(unlink((src_ + "/random.bin").c_str()), 0);
    EXPECT_EQ(run(1).substr(0, 3), "25 ");
    EXPECT_EQ(TreeManifest(dst_).size(), got.size());  // one of the two stays
}

// rsync's own overall figure counts the bytes it moved, so a run that sends little of a large
// tree ends far below 100; a complete run must still end at 100 (once), a failed one never.
TEST_F(WrapperRun, ProgressEndsAtHundredOnlyWhenTheRunSucceeds) {
    fs::create_directories(src_);
    WriteRandom(src_ + "/large.bin", 4 << 20, 3);
    for (int i = 0; i < 20; ++i) {
        WriteFile(src_ + "/f" + std::to_string(i), std::string(1000 + i, 'x'));
    }
    const auto run = [&](const std::string& module, int expected) {
        std::vector<int> seen;
        RsyncWrapper w;
        w.setSrcPath(src_ + "/");
        Aim(w, module);
        w.setProgressCallback([&seen](int percent) { seen.push_back(percent); });
        EXPECT_EQ(w.execute(kNoCancel), expected) << w.lastError();
        return seen;
    };
    EXPECT_EQ(run("photos", 0).back(), 100);
    WriteFile(src_ + "/f3", "changed");  // rsync's own figure stays near 0
    const std::vector<int> small = run("photos", 0);
    EXPECT_EQ(std::count(small.begin(), small.end(), 100), 1);
    const std::vector<int> failed = run("nosuchmodule", 5);
    EXPECT_EQ(std::count(failed.begin(), failed.end(), 100), 0);
}

// A cancelled transfer stops at once, mid-file, and leaves no rsync of its own behind.
TEST_F(WrapperRun, CancelStopsATransferInTheMiddle) {
    fs::create_directories(src_);
    WriteRandom(src_ + "/big.bin", 4 << 20, 9);
    RsyncWrapper w;
    w.setBandwidthLimit(256);  // 16 s for the whole file: the cancel comes in the middle
    w.setSrcPath(src_ + "/");
    Aim(w, "photos");
    std::atomic<bool> flowing{false};
    w.setProgressCallback([&](int) { flowing = true; });
    Clock::time_point asked;
    EXPECT_EQ(w.execute([&] {
        asked = flowing && asked == Clock::time_point() ? Clock::now() : asked;
        return flowing.load();
    }),
              RsyncWrapper::kResultCancelled);
    EXPECT_LT(Clock::now() - asked, std::chrono::seconds(4));
    EXPECT_FALSE(fs::exists(dst_ + "/big.bin"));
    EXPECT_EQ(ProcessesMentioning(src_), 0) << "a process of the cancelled run survived";
}

// Every failure keeps the code that tells its cause: rsync's own (5 refused, 10 unreachable) or
// the wrapper's (1 settings, 14 no rsync, 53 a server hook that cannot start); never the password.
TEST_F(WrapperRun, FailuresKeepTheirCodes) {
    WriteFile(local_ / "f", "x");
    const std::string conf = pair_->Receiver().Root() + "/usr/vurn/etc/s2s_rsyncd.conf";
    const std::list<std::string> version = {"command=\"S2S_GetProtocolVer\"", "clientID=\"x\"",
                                            "outfile=\"" + (local_ / "out") + "\""};
    const auto breakHooks = [&](RsyncWrapper&) {
        std::string text = ReadFile(conf);
        text =
            std::regex_replace(text, std::regex("exec '[^']*'"), "exec '" + (local_ / "f") + "'");
        WriteFile(conf, text);
    };
    const struct Row {
        const char* name;
        std::string server, password, dest, module;
        std::function<void(RsyncWrapper&)> also;
        int expected;
        const char* said;
    } rows[] = {
        {"wrong password", "127.0.0.1", "not-the-pw", "photos", "", nullptr, 5, "auth failed"},
        {"unknown module", "127.0.0.1", kLongest, "no-such-share", "", nullptr, 5, ""},
        {"no password", "127.0.0.1", "", "photos", "", nullptr, RsyncWrapper::kResultUsage, ""},
        {"password too long", "127.0.0.1", kLongest + "p", "photos", "", nullptr,
         RsyncWrapper::kResultUsage, "longer than rsync accepts"},
        {"server looks like an option", "-oProxyCommand=x", kLongest, "photos", "", nullptr,
         RsyncWrapper::kResultUsage, ""},
        {"folder no module serves", "127.0.0.1", kLongest, "/etc", "vault", nullptr,
         RsyncWrapper::kResultUsage, ""},
        {"no rsync", "127.0.0.1", kLongest, "photos", "",
         [&](RsyncWrapper& w) { w.setRsyncPath(local_ / "no-rsync-here"); },
         RsyncWrapper::kResultSpawn, ""},
        // Hooks the daemon's shell cannot execute: rsync says 5 (early hook) or 4 (the key
        // module's pre-transfer hook), which would read as a refused password or action.
        {"command hook cannot start", "127.0.0.1", kLongest, "", "",
         [&](RsyncWrapper& w) { breakHooks(w), w.setVurnCustCmdRule(version); },
         RsyncWrapper::kResultHookFailed, "command hook could not start"},
        {"key hook cannot start", "127.0.0.1", kLongest, "/usr/vurn/etc/.encrypt", "vault", nullptr,
         RsyncWrapper::kResultHookFailed, ""},
        {"server down", "127.0.0.1", kLongest, "photos", "", [](RsyncWrapper&) { pair_->Stop(); },
         10, ""},
        {"server down, command", "127.0.0.1", kLongest, "", "",
         [&](RsyncWrapper& w) { w.setVurnCustCmdRule(version); }, 10, ""},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        RsyncWrapper w;
        w.setSrcPath(local_ / "f");
        Aim(w, "");
        w.setDestPath(row.server, "s2suser", row.password, row.dest, row.module);
        if (row.also) {
            row.also(w);
        }
        EXPECT_EQ(w.execute(kNoCancel), row.expected) << w.lastError();
        EXPECT_NE(w.lastError().find(row.said), std::string::npos) << w.lastError();
        EXPECT_EQ(w.lastError().find("not-the-pw"), std::string::npos);
    }
    // One byte too long is refused when the receiver is configured already.
    EXPECT_NE(ServerPair({"s2suser", kLongest + "p"}).Start().find("the password is too long"),
              std::string::npos);
    ASSERT_EQ(pair_->Start(), "");  // configured afresh for the tests after this one
}

// Commands return the server's exact code and output; an output never goes through a link, a
// server without the command module is 51, a command file over 4096 bytes is refused here.
TEST_F(WrapperRun, CommandsReturnTheServersCodeAndOutput) {
    const std::string out = local_ / "version";
    WriteFile(out, "stale");
    RsyncWrapper listOnly;
    listOnly.setListOnly(true);  // the version query runs as a list-only task; the reply arrives
    Aim(listOnly, "");
    listOnly.setVurnCustCmdRule(
        {"command=\"S2S_GetProtocolVer\"", "clientID=\"SN-1\"", "outfile=\"" + out + "\""});
    EXPECT_EQ(listOnly.execute(kNoCancel), 0) << listOnly.lastError();
    EXPECT_EQ(ReadFile(out), "1\n");
    WriteFile(local_ / "victim", "precious");
    ASSERT_EQ(symlink((local_ / "victim").c_str(), (local_ / "linked").c_str()), 0);
    EXPECT_EQ(Command({"command=\"S2S_GetProtocolVer\"", "clientID=\"SN-1\"",
                       "outfile=\"" + (local_ / "linked") + "\""}),
              RsyncWrapper::kResultLocalFile);
    EXPECT_EQ(ReadFile(local_ / "victim"), "precious");
    EXPECT_EQ(Command({"command=\"S2S_NoSuchThing\"", "clientID=\"abc\""}), 43);
    EXPECT_EQ(Command({"command=\"S2S_SyncStart\"", "clientID=\"abc\"", "volumeName=\"volume1\"",
                       "shareName=\"../etc\""}),
              204);
    EXPECT_EQ(Command({"command=\"S2S_GetProtocolVer\"", "clientID=\"abc\""}, "@not-a-module"),
              RsyncWrapper::kResultNoCommands);
    EXPECT_EQ(Command({"command=\"S2S_UpdateTaskStatus\"", "clientID=\"abc\"",
                       "taskName=\"" + std::string(5000, 't') + "\""}),
              RsyncWrapper::kResultUsage);
    ExpectCleanSpool();
}

// A command answers once its reply is in place; inside a LeftRunsScope the rest of rsync's run
// ends by the scope's end, elsewhere before execute() returns, and its private folder with it.
TEST_F(WrapperRun, CommandRunsLeaveNothingOnceFinished) {
    TempDir tmp("s2s-cmd-tmp");
    ScopedEnv env("TMPDIR", tmp.path().c_str());
    EXPECT_EQ(Command({"command=\"S2S_NoSuchThing\"", "clientID=\"abc\""}), 43);
    EXPECT_TRUE(fs::is_empty(tmp.path())) << "a library user's execute() left rsync running";
    {
        S2S::rsync_internal::LeftRunsScope scope;
        EXPECT_EQ(Command({"command=\"S2S_NoSuchThing\"", "clientID=\"abc\""}), 43);
    }
    EXPECT_TRUE(fs::is_empty(tmp.path()));
    ExpectCleanSpool();
}

TEST_F(WrapperRun, ConcurrentCommandsStayApart) {
    constexpr int kClients = 8;
    std::vector<std::thread> threads;
    std::vector<int> codes(kClients, -1);
    std::vector<std::string> outputs(kClients);
    for (int i = 0; i < kClients; ++i) {
        threads.emplace_back([&, i] {
            const std::string out = local_ / ("out" + std::to_string(i));
            const std::string id = "clientID=\"C" + std::to_string(i) + "\"";
            // Even clients ask the version, odd ones something the server refuses.
            codes[i] =
                i % 2 == 0
                    ? Command({"command=\"S2S_GetProtocolVer\"", id, "outfile=\"" + out + "\""})
                    : Command({"command=\"S2S_SyncFinish\"", id, "finishType=\"bogus\"",
                               "name=\"photos\""});
            outputs[i] = ReadFile(out);
        });
    }
    for (auto& t : threads) {
        t.join();
    }
    for (int i = 0; i < kClients; ++i) {
        EXPECT_EQ(codes[i], i % 2 == 0 ? 0 : 211) << i;
        EXPECT_EQ(outputs[i], i % 2 == 0 ? "1\n" : "") << i;
    }
    ExpectCleanSpool();
}

// The command transport on its own: a daemon whose command module runs a stand-in handler that
// answers with the code and output size named in the command file. Exact codes and outputs up
// to 1 MiB arrive; a larger output is not delivered.
TEST(WrapperTransport, ExactCodesAndOutputsUpToOneMebibyte) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "the daemon's chroot needs root";
    }
    TempDir dir("s2s-transport");
    const std::string d = dir.path();
    fs::create_directories(d + "/replies");
    WriteFile(d + "/secrets", "u:" + std::string(kPassword) + "\n");
    chmod((d + "/secrets").c_str(), 0600);
    // The command file's key="value" lines are shell assignments: token, code, size.
    WriteFile(d + "/handler.sh", "#!/bin/sh\neval \"$(cat)\"\nr=" + d +
                                     "/replies/$token\nmkdir \"$r\" || exit 1\nhead -c \"$size\" "
                                     "/dev/zero | tr '\\0' x > \"$r/output\"\necho \"$code\" > "
                                     "\"$r/result\"\n");
    chmod((d + "/handler.sh").c_str(), 0755);
    const int port = FreeTcpPort();
    WriteFile(d + "/rsyncd.conf",
              "port = " + std::to_string(port) +
                  "\naddress = 127.0.0.1\nuse chroot = yes\n[@s2s-cmd]\npath = " + d +
                  "/replies\nauth users = u\nsecrets file = " + d + "/secrets\nearly exec = " + d +
                  "/handler.sh\n");
    Program daemon({"/usr/bin/rsync", "--daemon", "--no-detach", "--config=" + d + "/rsyncd.conf"});
    const auto run = [&](int code, size_t size) {
        WriteFile(d + "/out", "before");
        RsyncWrapper w;
        w.setPort(port);
        w.setVurnAuth(true, true);
        w.setDestPath("127.0.0.1", "u", kPassword, "", "");
        w.setVurnCustCmdRule({"command=\"X\"", "code=\"" + std::to_string(code) + "\"",
                              "size=\"" + std::to_string(size) + "\"",
                              "outfile=\"" + d + "/out\""});
        int rc = -1;
        WaitFor([&] { return (rc = w.execute(kNoCancel)) != 10; });  // 10: not listening yet
        return rc;
    };
    for (const auto& [code, size] : std::vector<std::pair<int, size_t>>{
             {0, 0}, {214, 17}, {207, 1}, {4242, 1 << 20}, {3, 100}}) {
        EXPECT_EQ(run(code, size), code);
        EXPECT_EQ(ReadFile(d + "/out"), std::string(size, 'x')) << code;
    }
    EXPECT_EQ(run(0, (1 << 20) + 1), 0);
    EXPECT_EQ(ReadFile(d + "/out"), "before") << "an oversized output was delivered";
}

}  // namespace
