// RsyncWrapper against a real rsync daemon set up by s2s-receiver on a free loopback port: data
// runs (ownership, permissions, times, links, sparse and large files, non-ASCII names, deletes,
// excludes, relative paths), the key module, cancellation, a wrong password, a server that is
// down, and the command transport (exact result codes, 1 MiB output, concurrency, clean spool).
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <fstream>
#include <map>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "gtest/gtest.h"
#include "rsync/wrapper_fixture.h"
#include "s2s_rsync_wrapper.h"

namespace {

using VURN::Backup::RsyncWrapper;
using wrapper_test::CountEntries;
using wrapper_test::MakeDirs;
using wrapper_test::Server;

const char kClientID[] = "SN-TEST-CLIENT";

// Incompressible content: one random MiB, varied per MiB so that no two blocks are equal.
void WriteRandom(const std::string& path, size_t size, unsigned seed) {
    std::mt19937 gen(seed);
    std::string block(1 << 20, '\0');
    for (char& c : block) {
        c = static_cast<char>(gen());
    }
    std::string data;
    data.reserve(size);
    for (size_t n = 0; data.size() < size; ++n) {
        block[n % block.size()] ^= static_cast<char>(n + 1);
        data.append(block, 0, std::min(block.size(), size - data.size()));
    }
    s2s_test::WriteFile(path, data);
}

void SetMtime(const std::string& path, time_t when) {
    struct timeval tv[2] = {{when, 0}, {when, 0}};
    lutimes(path.c_str(), tv);
}

// Type, mode, owner, mtime, size, content and link target of every entry below `root`, and
// which regular files share an inode.
std::map<std::string, std::string> Snapshot(const std::string& root) {
    std::map<std::string, std::string> out;
    std::map<ino_t, std::string> inodes;
    std::vector<std::string> pending = {""};
    while (!pending.empty()) {
        std::string rel = pending.back();
        pending.pop_back();
        DIR* d = opendir((root + rel).c_str());
        if (d == nullptr) {
            continue;
        }
        std::vector<std::string> names;
        while (struct dirent* e = readdir(d)) {
            std::string n = e->d_name;
            if (n != "." && n != "..") {
                names.push_back(n);
            }
        }
        closedir(d);
        for (const auto& n : names) {
            std::string child = rel + "/" + n;
            struct stat st;
            lstat((root + child).c_str(), &st);
            std::string desc = std::to_string(st.st_mode) + " " + std::to_string(st.st_uid) + ":" +
                               std::to_string(st.st_gid);
            if (S_ISDIR(st.st_mode)) {
                pending.push_back(child);
            } else {
                desc += " t" + std::to_string(st.st_mtime) + " s" + std::to_string(st.st_size);
            }
            if (S_ISLNK(st.st_mode)) {
                char target[4096];
                ssize_t len = readlink((root + child).c_str(), target, sizeof target);
                desc += " ->" + std::string(target, len > 0 ? static_cast<size_t>(len) : 0);
            } else if (S_ISREG(st.st_mode)) {
                std::string content = s2s_test::ReadFile(root + child);
                desc += " h" + std::to_string(std::hash<std::string>()(content));
                if (st.st_nlink > 1) {
                    auto it = inodes.emplace(st.st_ino, child).first;
                    desc += " link:" + it->second;
                }
            }
            out[child] = desc;
        }
    }
    return out;
}

// Processes whose command line mentions `needle` (the test's unique paths).
int ProcessesMentioning(const std::string& needle) {
    int n = 0;
    DIR* d = opendir("/proc");
    while (struct dirent* e = readdir(d)) {
        if (e->d_name[0] < '0' || e->d_name[0] > '9' || atoi(e->d_name) == getpid()) {
            continue;
        }
        std::string cmd = s2s_test::ReadFile(std::string("/proc/") + e->d_name + "/cmdline");
        std::string stat = s2s_test::ReadFile(std::string("/proc/") + e->d_name + "/stat");
        size_t paren = stat.rfind(')');
        bool zombie =
            paren != std::string::npos && paren + 2 < stat.size() && stat[paren + 2] == 'Z';
        if (!zombie && cmd.find(needle) != std::string::npos) {
            ++n;
        }
    }
    closedir(d);
    return n;
}

class WrapperTest : public ::testing::Test {
  protected:
    void SetUp() override {
        if (geteuid() != 0) {
            GTEST_SKIP() << "the receiver's daemon needs root (chroot, ownership)";
        }
        server_.reset(new Server());
        server_->AddShare("photos");
        server_->AddShare("docs");
        server_->AddShare("vault", true);
        std::string error = server_->Start();
        ASSERT_EQ(error, "");
    }

    // The daemon removes a reply after its client has gone, so the spool empties shortly after.
    void ExpectCleanSpool() const {
        EXPECT_TRUE(s2s_test::WaitFor([&] {
            return CountEntries(server_->Spool() + "/replies") == 0 &&
                   CountEntries(server_->Spool() + "/conns") == 0;
        })) << "replies left in the spool";
    }

    std::unique_ptr<Server> server_;
    s2s_test::TempDir local_{"s2s-wrapper-src"};
};

TEST_F(WrapperTest, DataRunsKeepMetadataAndFollowChanges) {
    const std::string src = local_.path() + "/share";
    MakeDirs(src + "/sub/deeper");
    s2s_test::WriteFile(src + "/plain.txt", "hello\n");
    s2s_test::WriteFile(src + "/sub/Ünïcødé ファイル.txt", "non-ascii\n");
    chmod((src + "/plain.txt").c_str(), 0640);
    chown((src + "/plain.txt").c_str(), 1234, 5678);
    s2s_test::WriteFile(src + "/sub/deeper/exec.sh", "#!/bin/sh\n");
    chmod((src + "/sub/deeper/exec.sh").c_str(), 0751);
    symlink("../plain.txt", (src + "/sub/link").c_str());
    symlink("/nowhere/absolute", (src + "/dangling").c_str());
    link((src + "/plain.txt").c_str(), (src + "/hard.txt").c_str());
    WriteRandom(src + "/large.bin", 24 << 20, 1);
    {
        int fd = open((src + "/sparse.img").c_str(), O_WRONLY | O_CREAT, 0600);
        ASSERT_EQ(pwrite(fd, "end", 3, (64 << 20) - 3), 3);
        close(fd);
    }
    s2s_test::WriteFile(src + "/skip.tmp", "excluded\n");
    MakeDirs(src + "/cache");
    s2s_test::WriteFile(src + "/cache/x", "excluded\n");
    for (const char* p : {"/plain.txt", "/sub/deeper/exec.sh", "/large.bin", "/sparse.img"}) {
        SetMtime(src + p, 1500000000);
    }

    auto run = [&](long long maxDelete = -1, int expected = 0) {
        RsyncWrapper w;
        w.setMaxDelete(maxDelete);
        w.setDelete(true);
        w.setNumericIds(true);
        w.setVurnPseudoRoot(true);
        w.setTimeout(600);
        w.setExcludeRule({"*.tmp", "/cache/"});
        w.setSrcPath(src + "/");
        server_->Aim(w, "photos");
        int rc = w.execute(boost::function<bool()>());
        EXPECT_EQ(rc, expected) << w.lastError();
    };
    run();
    auto expected = Snapshot(src);
    expected.erase("/skip.tmp");
    expected.erase("/cache");
    expected.erase("/cache/x");
    EXPECT_EQ(Snapshot(server_->SharePath("photos")), expected);
    struct stat st;
    ASSERT_EQ(stat((server_->SharePath("photos") + "/sparse.img").c_str(), &st), 0);
    EXPECT_LT(st.st_blocks * 512, 1 << 20) << "the sparse file arrived filled";

    // Change, delete and add; the next run mirrors it, excluded files stay untouched.
    s2s_test::WriteFile(src + "/plain.txt", "changed content\n");
    unlink((src + "/sub/link").c_str());
    unlink((src + "/hard.txt").c_str());
    s2s_test::RemoveTree(src + "/sub/deeper");
    s2s_test::WriteFile(src + "/new.txt", "new\n");
    s2s_test::WriteFile(server_->SharePath("photos") + "/keep.tmp", "server-side excluded\n");
    run();
    expected = Snapshot(src);
    expected.erase("/skip.tmp");
    expected.erase("/cache");
    expected.erase("/cache/x");
    auto got = Snapshot(server_->SharePath("photos"));
    EXPECT_EQ(got.count("/keep.tmp"), 1u);
    got.erase("/keep.tmp");
    EXPECT_EQ(got, expected);

    // A daemon ends a push whose deletions the limit stopped with 0; the run still reports 25.
    unlink((src + "/new.txt").c_str());
    unlink((src + "/plain.txt").c_str());
    run(1, 25);
    EXPECT_EQ(Snapshot(server_->SharePath("photos")).size(), got.size());  // one of the two stays
}

// A file rewritten with the same size within the second of the previous run, and a folder whose
// entries changed then, must still be mirrored: times are compared to the nanosecond.
TEST_F(WrapperTest, ChangesWithinTheSameSecondAreNotMissed) {
    const std::string src = local_.path() + "/share";
    MakeDirs(src + "/dir");
    auto setTime = [](const std::string& path, long nsec) {
        struct timespec times[2] = {{1600000000, nsec}, {1600000000, nsec}};
        ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW), 0) << path;
    };
    auto mtimeOf = [](const std::string& path) {
        struct stat st;
        EXPECT_EQ(lstat(path.c_str(), &st), 0) << path;
        return std::make_pair(st.st_mtim.tv_sec, st.st_mtim.tv_nsec);
    };
    s2s_test::WriteFile(src + "/dir/same-size.txt", "first\n");
    s2s_test::WriteFile(src + "/dir/gone.txt", "removed later\n");
    setTime(src + "/dir/same-size.txt", 100000000);
    setTime(src + "/dir", 100000000);
    auto run = [&]() {
        RsyncWrapper w;
        w.setDelete(true);
        w.setNumericIds(true);
        w.setVurnPseudoRoot(true);
        w.setSrcPath(src + "/");
        server_->Aim(w, "docs");
        EXPECT_EQ(w.execute(boost::function<bool()>()), 0) << w.lastError();
    };
    run();
    const std::string dst = server_->SharePath("docs");
    s2s_test::WriteFile(src + "/dir/same-size.txt", "later\n");
    unlink((src + "/dir/gone.txt").c_str());
    setTime(src + "/dir/same-size.txt", 900000000);
    setTime(src + "/dir", 900000000);
    run();
    EXPECT_EQ(s2s_test::ReadFile(dst + "/dir/same-size.txt"), "later\n");
    EXPECT_EQ(mtimeOf(dst + "/dir/same-size.txt"), mtimeOf(src + "/dir/same-size.txt"));
    EXPECT_EQ(mtimeOf(dst + "/dir"), mtimeOf(src + "/dir"));
    EXPECT_NE(access((dst + "/dir/gone.txt").c_str(), F_OK), 0);
}

// rsync's own overall figure counts the bytes it moved, so a run that sends little of a large
// tree ends far below 100; a complete run must still end at 100, a failed one never.
TEST_F(WrapperTest, ProgressEndsAtHundredOnlyWhenTheRunSucceeds) {
    const std::string src = local_.path() + "/share";
    MakeDirs(src + "/sub");
    WriteRandom(src + "/large.bin", 8 << 20, 3);
    for (int i = 0; i < 20; ++i) {
        s2s_test::WriteFile(src + "/sub/f" + std::to_string(i), std::string(1000 + i, 'x'));
    }
    auto run = [&](const std::string& module, std::vector<int>* seen) {
        RsyncWrapper w;
        w.setDelete(true);
        w.setSrcPath(src + "/");
        server_->Aim(w, module);
        w.setProgressCallback([seen](int percent) { seen->push_back(percent); });
        return w.execute(boost::function<bool()>());
    };
    std::vector<int> full;
    ASSERT_EQ(run("photos", &full), 0);
    ASSERT_FALSE(full.empty());
    EXPECT_EQ(full.back(), 100);

    // Only a small file changed: rsync's figure stays near 0, the run is still complete.
    s2s_test::WriteFile(src + "/sub/f3", "changed");
    std::vector<int> small;
    ASSERT_EQ(run("photos", &small), 0);
    ASSERT_FALSE(small.empty());
    EXPECT_EQ(small.back(), 100);
    EXPECT_EQ(std::count(small.begin(), small.end(), 100), 1) << "100 is reported once";

    std::vector<int> failed;
    EXPECT_EQ(run("nosuchmodule", &failed), 5);
    EXPECT_EQ(std::count(failed.begin(), failed.end(), 100), 0);
}

// rsync's --sparse costs the receiver half its CPU time again on data without holes: it is asked
// for only when the source holds a file with holes, and such a file still arrives with them.
TEST_F(WrapperTest, SparseHandlingOnlyForTreesWithHoles) {
    const std::string args = local_.path() + "/args";
    const std::string recorder = local_.path() + "/rsync-recorder";
    s2s_test::WriteFile(recorder,
                        "#!/bin/sh\nprintf '%s\\n' \"$@\" >> '" + args + "'\nexec rsync \"$@\"\n");
    chmod(recorder.c_str(), 0755);
    const std::string src = local_.path() + "/tree";
    MakeDirs(src + "/a/b");
    WriteRandom(src + "/a/dense.bin", 3 << 20, 7);
    s2s_test::WriteFile(src + "/a/b/small", "x");
    s2s_test::WriteFile(src + "/empty", "");
    auto run = [&]() {
        unlink(args.c_str());
        RsyncWrapper w;
        w.setRsyncPath(recorder);
        w.setSrcPath(src + "/");
        server_->Aim(w, "photos");
        EXPECT_EQ(w.execute(boost::function<bool()>()), 0) << w.lastError();
        return s2s_test::ReadFile(args);
    };
    std::string argv = run();
    EXPECT_NE(argv.find("--hard-links\n"), std::string::npos) << argv;
    EXPECT_EQ(argv.find("--sparse"), std::string::npos) << argv;

    // A hole deep in the tree, behind a file that merely looks short of blocks (empty).
    {
        int fd = open((src + "/a/b/disk.img").c_str(), O_WRONLY | O_CREAT, 0600);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(pwrite(fd, "head", 4, 0), 4);
        ASSERT_EQ(pwrite(fd, "tail", 4, (32 << 20) - 4), 4);
        close(fd);
    }
    argv = run();
    EXPECT_NE(argv.find("--sparse\n"), std::string::npos) << argv;
    struct stat st;
    ASSERT_EQ(stat((server_->SharePath("photos") + "/a/b/disk.img").c_str(), &st), 0);
    EXPECT_EQ(st.st_size, 32 << 20);
    EXPECT_LT(st.st_blocks * 512, 1 << 20) << "the holes were filled";
}

TEST_F(WrapperTest, RelativeRunRecreatesThePathInsideTheModule) {
    const std::string src = local_.path() + "/share";
    MakeDirs(src + "/a/b");
    s2s_test::WriteFile(src + "/a/b/f", "x");
    s2s_test::WriteFile(src + "/a/other", "not sent");
    RsyncWrapper w;
    w.setRelativePath(true);
    w.setSrcPath(src + "/./a/b");
    server_->Aim(w, "docs");
    ASSERT_EQ(w.execute(boost::function<bool()>()), 0) << w.lastError();
    EXPECT_EQ(s2s_test::ReadFile(server_->SharePath("docs") + "/a/b/f"), "x");
    EXPECT_NE(access((server_->SharePath("docs") + "/a/other").c_str(), F_OK), 0);

    // The debug log grows with every run: once full it is moved aside before the next one, and
    // only the newest old logs are kept.
    const std::string log = local_.path() + "/rsync.log";
    s2s_test::WriteFile(log + ".1", "older");
    s2s_test::WriteFile(log + ".3", "oldest");
    s2s_test::WriteFile(log, "full log\n");
    ASSERT_EQ(truncate(log.c_str(), RsyncWrapper::kLogRotateBytes), 0);
    RsyncWrapper logged;
    logged.setDebugLog(true);
    logged.setLogFile(log);
    logged.setSrcPath(src + "/a/b/f");
    server_->Aim(logged, "docs");
    ASSERT_EQ(logged.execute(boost::function<bool()>()), 0) << logged.lastError();
    struct stat st;
    ASSERT_EQ(stat(log.c_str(), &st), 0);
    EXPECT_LT(st.st_size, 100000);
    EXPECT_EQ(s2s_test::ReadFile(log + ".1").compare(0, 9, "full log\n"), 0);
    EXPECT_EQ(s2s_test::ReadFile(log + ".2"), "older");
    EXPECT_EQ(access((log + ".4").c_str(), F_OK), -1);
}

TEST_F(WrapperTest, EncryptedModuleAndKeyDirectory) {
    const std::string cipher = local_.path() + "/@vault@";
    MakeDirs(cipher);
    s2s_test::WriteFile(cipher + "/ENCRYPTED-NAME", "ciphertext");
    RsyncWrapper data;
    data.setSrcPath(cipher + "/");
    server_->Aim(data, "@vault@");
    ASSERT_EQ(data.execute(boost::function<bool()>()), 0) << data.lastError();
    EXPECT_EQ(s2s_test::ReadFile(server_->EncryptedPath("vault") + "/ENCRYPTED-NAME"),
              "ciphertext");

    // An absolute server directory with a module: the key lands in a directory named after the
    // share inside the key directory, and the key module cannot be read back.
    s2s_test::WriteFile(local_.path() + "/vault.key", "KEY");
    RsyncWrapper key;
    key.setSrcPath(local_.path() + "/vault.key");
    server_->Aim(key, "/usr/vurn/etc/.encrypt", "vault");
    ASSERT_EQ(key.execute(boost::function<bool()>()), 0) << key.lastError();
    EXPECT_EQ(s2s_test::ReadFile(server_->KeyDir() + "/vault/vault.key"), "KEY");

    RsyncWrapper unmapped;
    unmapped.setSrcPath(local_.path() + "/vault.key");
    server_->Aim(unmapped, "/etc", "vault");
    EXPECT_EQ(unmapped.execute(boost::function<bool()>()), RsyncWrapper::kResultUsage);
}

TEST_F(WrapperTest, CancelStopsTheWholeRunQuickly) {
    const std::string src = local_.path() + "/big";
    MakeDirs(src);
    for (int i = 0; i < 4; ++i) {
        WriteRandom(src + "/f" + std::to_string(i), 48 << 20, 10 + i);
    }
    RsyncWrapper w;
    w.setCompress(true);  // slows the transfer down enough to be caught in the middle
    w.setSrcPath(src + "/");
    server_->Aim(w, "photos");
    std::atomic<int> progressCalls{0};
    w.setProgressCallback([&](int) { ++progressCalls; });
    std::atomic<bool> passwordSeen{false};
    std::chrono::steady_clock::time_point asked;
    int polls = 0;
    int rc = w.execute([&]() {
        ++polls;
        auto now = std::chrono::steady_clock::now();
        if (polls == 3) {
            passwordSeen = ProcessesMentioning(server_->Password()) > 0;
        }
        // Once data flows: in the middle of the transfer.
        if (polls >= 3 && progressCalls > 0) {
            asked = now;
            return true;
        }
        return false;
    });
    auto stopped = std::chrono::steady_clock::now();
    EXPECT_EQ(rc, RsyncWrapper::kResultCancelled);
    EXPECT_LT(stopped - asked, std::chrono::seconds(4));
    EXPECT_GE(polls, 3);
    EXPECT_FALSE(passwordSeen) << "the password showed on a command line";
    EXPECT_EQ(ProcessesMentioning(src), 0) << "a process of the cancelled run survived";
    EXPECT_GT(progressCalls.load(), 0);
}

TEST_F(WrapperTest, FailuresKeepRsyncsCodes) {
    s2s_test::WriteFile(local_.path() + "/f", "x");
    RsyncWrapper wrong;
    wrong.setSrcPath(local_.path() + "/f");
    server_->Aim(wrong, "photos");
    wrong.setDestPath("127.0.0.1", server_->User(), "not-the-password", "photos", "");
    EXPECT_EQ(wrong.execute(boost::function<bool()>()), 5);
    EXPECT_NE(wrong.lastError().find("auth failed"), std::string::npos) << wrong.lastError();
    EXPECT_EQ(wrong.lastError().find("not-the-password"), std::string::npos);

    RsyncWrapper unknown;
    unknown.setSrcPath(local_.path() + "/f");
    server_->Aim(unknown, "no-such-share");
    EXPECT_EQ(unknown.execute(boost::function<bool()>()), 5);

    RsyncWrapper noPassword;
    noPassword.setSrcPath(local_.path() + "/f");
    server_->Aim(noPassword, "photos");
    noPassword.setDestPath("127.0.0.1", server_->User(), "", "photos", "");
    EXPECT_EQ(noPassword.execute(boost::function<bool()>()), RsyncWrapper::kResultUsage);

    RsyncWrapper badServer;
    badServer.setSrcPath(local_.path() + "/f");
    server_->Aim(badServer, "photos");
    badServer.setDestPath("-oProxyCommand=x", server_->User(), server_->Password(), "photos", "");
    EXPECT_EQ(badServer.execute(boost::function<bool()>()), RsyncWrapper::kResultUsage);

    RsyncWrapper noRsync;
    noRsync.setRsyncPath(local_.path() + "/no-rsync-here");
    noRsync.setSrcPath(local_.path() + "/f");
    server_->Aim(noRsync, "photos");
    EXPECT_EQ(noRsync.execute(boost::function<bool()>()), RsyncWrapper::kResultSpawn);

    // Hooks the daemon's shell cannot execute (the handler gone, not executable, or unable to
    // load its library): the server failed, which is neither a refused password (rsync's 5 for
    // the early hook) nor a refused action (its 4 for the key module's pre-transfer hook).
    const std::string hook = local_.path() + "/not-executable";
    s2s_test::WriteFile(hook, "#!/bin/sh\nexit 0\n");
    const std::string conf = server_->Root() + "/usr/vurn/etc/s2s_rsyncd.conf";
    std::string text = s2s_test::ReadFile(conf);
    for (size_t at = text.find("exec '"); at != std::string::npos; at = text.find("exec '", at)) {
        at += 6;
        text.replace(at, text.find('\'', at) - at, hook);
    }
    s2s_test::WriteFile(conf, text);
    RsyncWrapper noHook;
    server_->Aim(noHook, "");
    noHook.setVurnCustCmdRule({"command=\"S2S_GetProtocolVer\"", "clientID=\"x\"",
                               "outfile=\"" + local_.path() + "/out\""});
    EXPECT_EQ(noHook.execute(boost::function<bool()>()), RsyncWrapper::kResultHookFailed);
    EXPECT_NE(noHook.lastError().find("command hook could not start"), std::string::npos)
        << noHook.lastError();
    RsyncWrapper noKeyHook;
    noKeyHook.setSrcPath(local_.path() + "/f");
    server_->Aim(noKeyHook, "/usr/vurn/etc/.encrypt", "vault");
    EXPECT_EQ(noKeyHook.execute(boost::function<bool()>()), RsyncWrapper::kResultHookFailed)
        << noKeyHook.lastError();

    server_->Stop();
    RsyncWrapper down;
    down.setSrcPath(local_.path() + "/f");
    server_->Aim(down, "photos");
    EXPECT_EQ(down.execute(boost::function<bool()>()), 10);
    RsyncWrapper downCmd;
    server_->Aim(downCmd, "");
    downCmd.setVurnCustCmdRule({"command=\"S2S_GetProtocolVer\"", "clientID=\"x\"",
                                "outfile=\"" + local_.path() + "/out\""});
    EXPECT_EQ(downCmd.execute(boost::function<bool()>()), 10);
}

TEST_F(WrapperTest, CommandsReturnTheServersCodeAndOutput) {
    const std::string out = local_.path() + "/version";
    s2s_test::WriteFile(out, "stale");
    RsyncWrapper w;
    w.setListOnly(true);  // the version query runs as a list-only task; the reply still arrives
    server_->Aim(w, "");
    w.setVurnCustCmdRule({"command=\"S2S_GetProtocolVer\"",
                          std::string("clientID=\"") + kClientID + "\"",
                          "outfile=\"" + out + "\""});
    EXPECT_EQ(w.execute(boost::function<bool()>()), 0) << w.lastError();
    EXPECT_EQ(s2s_test::ReadFile(out), "1\n");

    // The server chose the output's content: it never goes through a link to another file.
    const std::string victim = local_.path() + "/victim";
    s2s_test::WriteFile(victim, "precious");
    ASSERT_EQ(symlink(victim.c_str(), (local_.path() + "/linked").c_str()), 0);
    RsyncWrapper linked;
    server_->Aim(linked, "");
    linked.setVurnCustCmdRule({"command=\"S2S_GetProtocolVer\"",
                               std::string("clientID=\"") + kClientID + "\"",
                               "outfile=\"" + local_.path() + "/linked\""});
    EXPECT_EQ(linked.execute(boost::function<bool()>()), RsyncWrapper::kResultLocalFile);
    EXPECT_NE(linked.lastError().find("symbolic link"), std::string::npos) << linked.lastError();
    EXPECT_EQ(s2s_test::ReadFile(victim), "precious");

    RsyncWrapper unknown;
    server_->Aim(unknown, "");
    unknown.setVurnCustCmdRule({"command=\"S2S_NoSuchThing\"", "clientID=\"abc\""});
    EXPECT_EQ(unknown.execute(boost::function<bool()>()), 43);

    RsyncWrapper bad;
    server_->Aim(bad, "");
    bad.setVurnCustCmdRule({"command=\"S2S_SyncStart\"", "clientID=\"abc\"",
                            "volumeName=\"volume1\"", "shareName=\"../etc\""});
    EXPECT_EQ(bad.execute(boost::function<bool()>()), 204);

    RsyncWrapper noModule;
    server_->Aim(noModule, "");
    noModule.setCommandModule("@not-a-command-module");
    noModule.setVurnCustCmdRule({"command=\"S2S_GetProtocolVer\"", "clientID=\"abc\""});
    EXPECT_EQ(noModule.execute(boost::function<bool()>()), RsyncWrapper::kResultNoCommands);

    RsyncWrapper huge;
    server_->Aim(huge, "");
    huge.setVurnCustCmdRule({"command=\"S2S_UpdateTaskStatus\"", "clientID=\"abc\"",
                             "taskName=\"" + std::string(5000, 't') + "\""});
    EXPECT_EQ(huge.execute(boost::function<bool()>()), RsyncWrapper::kResultUsage);

    ExpectCleanSpool();
}

// The daemon protocol trades small messages both ways. Without TCP_NODELAY on both ends each of
// several exchanges waits for the peer's delayed ACK (at least 40 ms on Linux), which made every
// command and every run cost well over 150 ms however little it moved.
TEST_F(WrapperTest, RunsDoNotWaitForDelayedAcks) {
    const std::string src = local_.path() + "/small";
    MakeDirs(src);
    s2s_test::WriteFile(src + "/f", "x");
    double fastestCommand = 1e9;
    double fastestTransfer = 1e9;
    for (int i = 0; i < 5; ++i) {
        RsyncWrapper cmd;
        server_->Aim(cmd, "");
        cmd.setVurnCustCmdRule({"command=\"S2S_GetProtocolVer\"",
                                std::string("clientID=\"") + kClientID + "\"",
                                "outfile=\"" + local_.path() + "/v\""});
        auto start = std::chrono::steady_clock::now();
        ASSERT_EQ(cmd.execute(boost::function<bool()>()), 0) << cmd.lastError();
        auto mid = std::chrono::steady_clock::now();
        RsyncWrapper copy;
        copy.setSrcPath(src + "/");
        server_->Aim(copy, "docs");
        ASSERT_EQ(copy.execute(boost::function<bool()>()), 0) << copy.lastError();
        auto end = std::chrono::steady_clock::now();
        fastestCommand = std::min(fastestCommand,
                                  std::chrono::duration<double, std::milli>(mid - start).count());
        fastestTransfer =
            std::min(fastestTransfer, std::chrono::duration<double, std::milli>(end - mid).count());
    }
    EXPECT_LT(fastestCommand, 150.0);
    EXPECT_LT(fastestTransfer, 120.0);
}

TEST_F(WrapperTest, ConcurrentCommandsStayApart) {
    constexpr int kClients = 8;
    std::vector<std::thread> threads;
    std::vector<int> codes(kClients, -1);
    std::vector<std::string> outputs(kClients);
    for (int i = 0; i < kClients; ++i) {
        threads.emplace_back([&, i]() {
            const std::string out = local_.path() + "/out" + std::to_string(i);
            RsyncWrapper w;
            server_->Aim(w, "");
            // Odd clients ask a question the server refuses, even ones the version.
            if (i % 2 == 0) {
                w.setVurnCustCmdRule({"command=\"S2S_GetProtocolVer\"",
                                      "clientID=\"C" + std::to_string(i) + "\"",
                                      "outfile=\"" + out + "\""});
            } else {
                w.setVurnCustCmdRule({"command=\"S2S_SyncFinish\"",
                                      "clientID=\"C" + std::to_string(i) + "\"",
                                      "finishType=\"bogus\"", "name=\"photos\""});
            }
            codes[i] = w.execute(boost::function<bool()>());
            outputs[i] = s2s_test::ReadFile(out);
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

// rsync's daemon reads "user:password" lines of at most 1023 bytes: the longest password that fits
// authenticates; one byte more is refused by configure and, with its own message, by a run.
TEST(WrapperCredentials, LongestPasswordThatFitsWorksOneMoreIsRefused) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "needs root";
    }
    const std::string user = "u";
    const std::string longest(1021, 'p');
    EXPECT_TRUE(RsyncWrapper::credentialsFit(user, longest));
    EXPECT_FALSE(RsyncWrapper::credentialsFit(user, longest + "p"));
    {
        Server refused(user, longest + "p");
        const wrapper_test::Run r = refused.Configure();
        EXPECT_EQ(r.status, 1);
        EXPECT_NE(r.output.find("the password is too long"), std::string::npos) << r.output;
    }
    Server server(user, longest);
    server.AddShare("photos");
    ASSERT_EQ(server.Start(), "");
    s2s_test::TempDir local("s2s-wrapper-src");
    s2s_test::WriteFile(local / "f", "x");
    RsyncWrapper fits;
    fits.setSrcPath(local / "f");
    server.Aim(fits, "photos");
    EXPECT_EQ(fits.execute(boost::function<bool()>()), 0) << fits.lastError();
    RsyncWrapper tooLong;
    tooLong.setSrcPath(local / "f");
    server.Aim(tooLong, "photos");
    tooLong.setDestPath("127.0.0.1", user, longest + "p", "photos", "");
    EXPECT_EQ(tooLong.execute(boost::function<bool()>()), RsyncWrapper::kResultUsage);
    EXPECT_NE(tooLong.lastError().find("longer than rsync accepts"), std::string::npos);
}

// The transport on its own: a daemon whose command module runs a stand-in handler that answers
// with a code and output taken from the command file, to prove exact codes and 1 MiB outputs.
TEST(WrapperTransport, ExactCodesAndLargeOutputs) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "needs root";
    }
    s2s_test::TempDir dir("s2s-transport");
    const std::string d = dir.path();
    MakeDirs(d + "/replies");
    s2s_test::WriteFile(d + "/secrets", "u:pw-transport\n");
    chmod((d + "/secrets").c_str(), 0600);
    s2s_test::WriteFile(d + "/handler.sh",
                        "#!/bin/sh\n"
                        "in=$(cat)\n"
                        "tok=$(printf '%s\\n' \"$in\" | sed -n '1s/^token=\"\\(.*\\)\"$/\\1/p')\n"
                        "code=$(printf '%s\\n' \"$in\" | sed -n 's/^code=\"\\(.*\\)\"$/\\1/p')\n"
                        "size=$(printf '%s\\n' \"$in\" | sed -n 's/^size=\"\\(.*\\)\"$/\\1/p')\n"
                        "mkdir \"" +
                            d +
                            "/replies/$tok\" || exit 1\n"
                            "head -c \"$size\" /dev/zero | tr '\\0' 'x' > \"" +
                            d +
                            "/replies/$tok/output\"\n"
                            "echo \"$code\" > \"" +
                            d + "/replies/$tok/result\"\n");
    chmod((d + "/handler.sh").c_str(), 0755);
    int port = s2s_test::FreeTcpPort();
    s2s_test::WriteFile(d + "/rsyncd.conf",
                        "pid file = " + d + "/pid\nport = " + std::to_string(port) +
                            "\naddress = 127.0.0.1\nuse chroot = yes\n"
                            "[@s2s-cmd]\npath = " +
                            d +
                            "/replies\n"
                            "auth users = u\nsecrets file = " +
                            d + "/secrets\nearly exec = " + d + "/handler.sh\n");
    wrapper_test::Run started =
        wrapper_test::RunProgram({"/usr/bin/rsync", "--daemon", "--config=" + d + "/rsyncd.conf"});
    ASSERT_EQ(started.status, 0) << started.output;
    struct Stop {
        std::string pidFile;
        ~Stop() {
            pid_t pid = atoi(s2s_test::ReadFile(pidFile).c_str());
            if (pid > 1) {
                kill(pid, SIGTERM);
            }
        }
    } stop{d + "/pid"};
    ASSERT_TRUE(s2s_test::WaitFor([&] { return !s2s_test::ReadFile(d + "/pid").empty(); }));

    struct Case {
        int code;
        size_t size;
    };
    for (Case c : {Case{0, 0}, Case{214, 17}, Case{207, 1}, Case{4242, 1 << 20}, Case{3, 100}}) {
        const std::string out = d + "/out";
        s2s_test::WriteFile(out, "");
        RsyncWrapper w;
        w.setPort(port);
        w.setVurnAuth(true, true);
        w.setDestPath("127.0.0.1", "u", "pw-transport", "", "");
        w.setVurnCustCmdRule({"command=\"X\"", "code=\"" + std::to_string(c.code) + "\"",
                              "size=\"" + std::to_string(c.size) + "\"",
                              "outfile=\"" + out + "\""});
        // The daemon detaches before it listens: a refused connection (10) is tried again.
        int rc = -1;
        ASSERT_TRUE(s2s_test::WaitFor([&] {
            rc = w.execute(boost::function<bool()>());
            return rc != 10;
        }));
        EXPECT_EQ(rc, c.code) << w.lastError();
        EXPECT_EQ(s2s_test::ReadFile(out), std::string(c.size, 'x')) << c.code;
    }
    // Larger than 1 MiB is not accepted as an output: the caller's file stays as it was.
    s2s_test::WriteFile(d + "/out", "before");
    RsyncWrapper w;
    w.setPort(port);
    w.setVurnAuth(true, true);
    w.setDestPath("127.0.0.1", "u", "pw-transport", "", "");
    w.setVurnCustCmdRule(
        {"command=\"X\"", "code=\"0\"", "size=\"1048577\"", "outfile=\"" + d + "/out\""});
    EXPECT_EQ(w.execute(boost::function<bool()>()), 0);
    EXPECT_EQ(s2s_test::ReadFile(d + "/out"), "before") << "an oversized output was delivered";
}

}  // namespace
