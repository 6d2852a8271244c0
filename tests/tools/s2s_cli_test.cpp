// The s2s program end to end, by exit class: one table of local command lines (help, usage,
// strict task files, passwords, the share registry, next-run, no service), one table of syncs
// against a real receiver, and Ctrl-C mid-copy. Service answers are tested with s2sd.
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <functional>

#include "support/program.h"
#include "support/server_pair.h"
#include "support/tree_manifest.h"

namespace {

namespace fs = std::filesystem;

using s2s_test::Host;
using s2s_test::ProgramResult;
using s2s_test::WriteFile;

std::string Replace(std::string text, const std::string& from, const std::string& to) {
    for (size_t at = text.find(from); at != std::string::npos; at = text.find(from, at)) {
        text.replace(at, from.size(), to);
    }
    return text;
}

TEST(Cli, LocalCommandsGiveTheirExitClassAndReason) {
    Host host("cli", "SN-CLI");
    const std::string r = host.Root();
    const std::string pw = "secret\n", tooLong = std::string(1022, 'p') + "\n";  // 1 too many
    for (const auto& f : {std::make_pair("pw", pw), {"pw0644", pw}, {"pwlong", tooLong}}) {
        WriteFile(r + "/" + f.first, f.second);
        chmod((r + "/" + f.first).c_str(), f.first == std::string("pw0644") ? 0644 : 0600);
    }
    fs::create_directories(r + "/volume1/docs");
    fs::create_directories(r + "/volume1/vault");
    const std::string sync = "sync --server-ip 127.0.0.1 --user u --share docs --password-file ";
    const std::string valid = R"({"name": "t", "share_list": ["docs"], "server_ip": "1.2.3.4")";
    const std::string berlin = "next-run --at 09:00 --now 2024-10-26T23:00";
    // Arguments are split at blanks ('T' in a --now value stands for one); $R is the host's root,
    // $F a file holding `file`. A text starting with '!' must not appear in what is printed.
    const struct {
        std::string args;
        int status;
        std::string text;
        std::string file = "";
        mode_t mode = 0644;
        const char* tz = "UTC";
    } rows[] = {
        {"--help", 0, "130  cancelled"},
        {"--version", 0, ""},
        {"help task update", 0, "Usage: s2s"},
        {"", 2, ""},
        {"help frobnicate", 2, "unknown command 'frobnicate'"},
        {"task frobnicate", 2, ""},
        {"sync extra", 2, ""},
        {"sync --ssh-port 70000 --share a", 2, ""},
        {"sync --ssh-port", 2, "option '--ssh-port' needs a value (PORT)"},
        {"sync --compress=1", 2, "option '--compress' takes no value"},
        {"sync --compress --compress", 2, "option '--compress' given more than once"},
        {"next-run --at= --count 2", 2, "option '--at' needs a value"},
        {"sync --task a.json --server x", 2, ""},
        {"sync --share docs --max-delete 20%%", 2, "--max-delete"},
        {"next-run --mode Weekly", 2, ""},
        {"next-run --at 24:00", 2, "is not a time HH:MM"},
        {"sync --no-such-option", 2, "unknown option '--no-such-option'"},
        {"share", 2, ""},
        {"task run 1 2", 2, ""},
        {"task add --name t --share a --ssh --no-ssh", 2, ""},
        {"task status --interval 5", 2, ""},
        {"task history --count 0", 2, ""},
        {"sync --password secret --share docs", 2, "never given on the command line"},
        {"task update --password=secret", 2, "never given on the command line"},
        // The share registry.
        {"share list", 0, "no shares registered"},
        {"share add docs --path $R/volume1/docs", 0, ""},
        {"share add vault --path $R/volume1/vault --encrypted --key-len 32", 0, ""},
        {"share add docs --path $R/volume1/docs", 11, ""},
        {"share add docs --path $R/volume1/docs --acl --replace", 0, ""},
        {"share list", 0, "[acl]"},
        {"share list --json", 0, "\"encrypted\": true"},
        {"share add list --path $R/volume1/docs", 0, ""},
        {"share remove list", 0, ""},
        {"share remove list", 11, ""},
        {"share add a/b --path $R/volume1/docs", 2, ""},
        {"share add x --path $R/missing", 2, ""},
        {"share add x --path relative", 2, ""},
        // Where a password may come from.
        {sync + "$R/pw0644", 4, "can be read by other users"},
        {sync + "$R/missing", 4, ""},
        {sync + "$R", 4, "is not a regular file"},
        {sync + "$R/pwlong", 4, "the password is too long"},
        {"task add --name t --share docs --password-file $R/pw0644", 4, ""},
        // Task files, read strictly and checked like a sync would.
        {"task check sync", 3, "task file 'sync'"},
        {"task check $F", 3, "unknown key \"shares\"", R"({"name": "t", "shares": ["a"]})"},
        {"task check $F", 3, "key \"ssh_port\" must be a whole number", R"({"ssh_port": "22"})"},
        {"task check $F", 3, "key \"ssh_port\" must be a whole number",
         R"({"ssh_port": 4294967296})"},
        {"task check $F", 3, "key \"schedule_mode\" must be a whole number",
         R"({"schedule_mode": 2.5})"},
        {"task check $F", 3, "key \"compress\" must be true, false, 1 or 0", R"({"compress": 2})"},
        {"task check $F", 3, "key \"week_schd\" must be seven '0'/'1'",
         R"({"week_schd": "01111102"})"},
        {"task check $F", 3, "key \"max_delete\": deletion limit", R"({"max_delete": "20%%"})"},
        {"task check $F", 3, "'2147483648' is out of range (at most 2147483647)",
         R"({"max_delete": "2147483648"})"},
        {"task check $F", 3, "every entry must be a string", R"({"share_list": ["a", 1]})"},
        {"task check $F", 3, "key \"name\" appears more than once",
         R"({"name": "a", "name": "b"})"},
        {"task check $F", 3, "one JSON object", "[1, 2]"},
        {"task check $F", 3, "not valid JSON", R"({"name": "t",})"},
        {"task check $F", 3, "NUL character", R"({"name": "a\u0000b"})"},
        {"task show $F", 3, "other users can read it", valid + R"(, "pswd": "secret"})"},
        {"task show $F", 0, "!secret", valid + R"(, "pswd": "secret"})", 0600},
        {"task check $F", 0, "", valid + R"(, "user": "u"})"},
        {"task check $F", 3, "Empty user name ''", valid + "}"},
        {"task check $F", 3, "Invalid begin hour",
         valid + R"(, "user": "u", "schedule_begin_hour": 24})"},
        {"task check $F", 3, "Share 'nope' is not valid",
         R"({"name": "t", "share_list": ["nope"], "server_ip": "1.2.3.4", "user": "u"})"},
        {"sync --server-ip 10.0.0.1 --user u --share nope", 3, ""},
        {"task add --share docs", 3, ""},
        // Next runs, in the process's time zone.
        {"next-run --days mon,tue,wed,thu,fri --at 09:30 --every 04:00 --repeat 2 --now "
         "2026-11-21T10:00 --count 4",
         0,
         "Mon 2026-11-23 09:30:00 UTC (in 1d23h)\nMon 2026-11-23 13:30:00 UTC (in 2d03h)\n"
         "Mon 2026-11-23 17:30:00 UTC (in 2d07h)\nTue 2026-11-24 09:30:00 UTC (in 2d23h)\n"},
        {"next-run --mode once --begin 2026-12-24 --at 18:00 --now @1795000000", 0,
         "Thu 2026-12-24 18:00:00 IST", "", 0644, "Asia/Kolkata"},
        {"next-run --mode once --begin 2020-01-01", 0, "no further run"},
        {"next-run --mode manual --json", 0, "\"state\": \"manual\""},
        {"next-run --at 23:00 --every 00:30 --repeat 2", 3, "Invalid repeat in day"},
        {"next-run --task $F --now 2026-11-21T10:00", 0,
         "task \"t\": Tue 2026-12-01 02:00:00 UTC (in 9d16h)\n",
         R"({"name": "t", "schedule_mode": 3, "schedule_begin_day": 31, "schedule_begin_hour": 2})"},
        // The evening before the clocks go back: 09:00 by the wall clock; other front ends 08:00.
        {berlin, 0,
         "Sun 2024-10-27 09:00:00 CET (in 11h00m)\nnote: other front ends (--compatible) show "
         "Sun 2024-10-27 08:00:00 CET instead of Sun 2024-10-27 09:00:00 CET\n",
         "", 0644, "Europe/Berlin"},
        {berlin + " --compatible", 0, "Sun 2024-10-27 08:00:00 CET (in 10h00m)\n", "", 0644,
         "Europe/Berlin"},
        {"next-run --at 09:00 --now 2024-03-31T02:30", 2, "does not exist in the local time zone",
         "", 0644, "Europe/Berlin"},
        // The sync service is not running.
        {"task list", 20, "s2sd is not running"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.args);
        std::vector<std::string> args;
        WriteFile(r + "/f.json", row.file);
        chmod((r + "/f.json").c_str(), row.mode);
        std::istringstream words(Replace(Replace(row.args, "$F", r + "/f.json"), "$R", r));
        for (std::string word; words >> word;) {
            args.push_back(word.compare(0, 4, "2026") == 0 || word.compare(0, 4, "2024") == 0
                               ? Replace(word, "T", " ")
                               : word);
        }
        const ProgramResult p = host.Run("s2s", args, "", {{"TZ", row.tz}});
        EXPECT_EQ(p.status, row.status) << p.All();
        if (row.text[0] == '!') {
            EXPECT_EQ(p.All().find(row.text.substr(1)), std::string::npos) << p.All();
        } else {
            EXPECT_NE(p.All().find(row.text), std::string::npos) << p.All();
        }
    }
    struct stat st;
    EXPECT_EQ(stat((r + "/volume1/@vault@").c_str(), &st), 0) << "an encrypted share's folder";
    // A socket file nobody listens on: the service died.
    fs::create_directories(r + "/run/s2s");
    ASSERT_EQ(mknod((r + "/run/s2s/s2sd.sock").c_str(), S_IFSOCK | 0600, 0), 0);
    const ProgramResult p = host.Run("s2s", {"pause"});
    EXPECT_EQ(p.status, 20) << p.All();
    EXPECT_NE(p.err.find("refuses connections"), std::string::npos) << p.err;
}

// Incompressible bytes: a compressed copy stays slow enough to be caught in the middle.
void RandomFile(const std::string& path, size_t size) {
    WriteFile(
        path,
        s2s_test::RunProgram({"/usr/bin/head", "-c", std::to_string(size), "/dev/urandom"}).out);
}

// A sending host and the receiver's daemon on the standard port, in a private network.
class Sync : public ::testing::Test {
  protected:
    void SetUp() override {
        options_.standardPort = true;
        const std::string why = s2s_test::ServerPair::Unavailable(options_);
        if (!why.empty()) {
            GTEST_SKIP() << why;
        }
        pair_.reset(new s2s_test::ServerPair(options_));
        for (const char* share : {"docs", "media"}) {
            Sender().AddShare(share);
            pair_->Receiver().AddShare(share);
        }
    }
    Host& Sender() { return pair_->Sender(); }
    // `s2s sync` for the shares of `words`, then the options there.
    std::vector<std::string> Args(const std::string& words) {
        std::vector<std::string> args = {"sync", "--server-ip", "127.0.0.1", "--user",
                                         options_.user};
        std::istringstream in(words);
        bool options = false;
        for (std::string word; in >> word;) {
            options = options || word[0] == '-';
            args.insert(args.end(), options ? std::initializer_list<std::string>{word}
                                            : std::initializer_list<std::string>{"--share", word});
        }
        return args;
    }
    std::string Status() { return pair_->Receiver().Run("s2s-receiver", {"status"}).out; }
    std::map<std::string, std::string> Copy(const std::string& share) {
        return s2s_test::TreeManifest(pair_->Receiver().SharePath(share));
    }
    s2s_test::PairOptions options_;
    std::unique_ptr<s2s_test::ServerPair> pair_;
};

TEST_F(Sync, EachFailureHasItsExitClassMessageAndJson) {
    // A small file system on the receiver's share "small", in a mount namespace of this test's
    // own (the daemon started afterwards sees it; nothing outside does).
    if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr)) {
        GTEST_SKIP() << "needs a private mount namespace";
    }
    Sender().AddShare("small");
    ASSERT_EQ(mount("tmpfs", pair_->Receiver().AddShare("small").c_str(), "tmpfs", 0, "size=256k"),
              0);
    ASSERT_EQ(pair_->Start(), "");
    Host second("second", "SN-SECOND");
    second.AddShare("docs");
    const std::string docs = Sender().SharePath("docs");
    const std::string media = Sender().SharePath("media");
    fs::create_directories(docs + "/a/b");
    for (int i = 0; i < 10; ++i) {
        WriteFile(docs + "/a/b/" + std::to_string(i), "d");
        WriteFile(media + "/file" + std::to_string(i), std::string(100 + i, 'm'));
    }
    WriteFile(docs + "/name with spaces and \xc3\xa9", "x");
    ASSERT_EQ(symlink("a/b/1", (docs + "/link").c_str()), 0);
    // Before each row: the sender, with the right password; a row's set-up may change either.
    const Host* from = nullptr;
    std::string password;
    const std::string tmp = Sender().Root() + "/tmp/S2S";
    std::map<std::string, std::string> copy;
    auto emptied = [&] {
        s2s_test::RemoveTree(docs);
        fs::create_directories(docs + "/#recycle/old");
    };
    auto unmounted = [&] {
        WriteFile(Sender().Root() + "/etc/s2s/host.conf",
                  "[host]\n\tserial=\"SN-SENDER-0001\"\n[volumes]\n\t" + Sender().Volume() +
                      "=\"internal\"\n");
    };
    auto threeDeleted = [&] {
        Sender().WriteHostConf("SN-SENDER-0001");
        for (const char* name : {"/file1", "/file2", "/file3"}) {
            unlink((media + name).c_str());
        }
    };
    const struct {
        std::string args;  // shares, then options
        std::function<void()> before;
        int status;
        std::string err;          // in the standard error
        std::string out = "";     // in the standard output (the JSON summary)
        std::string absent = "";  // nowhere
    } rows[] = {
        {"docs media --json", nullptr, 0, "paired 2 shares", "\"result\": \"ok\"", "[ERROR]"},
        {"docs --json", [&] { from = &second; }, 7,
         "share 'docs' is already paired with another client", "\"result\": \"conflict\""},
        {"docs", [&] { password = "not the password"; }, 6,
         "refused user 's2suser' or its password", "", "not the password"},
        // A version query that fails for an unsafe temporary folder is never an old server.
        {"docs", [&] { chmod(tmp.c_str(), 0777); }, 1, "protocol version could not be read", "",
         "an old server"},
        {"gone docs --json", [&] { Sender().AddShare("gone"); }, 8,
         "does not serve share 'gone' (is it registered there?)", "\"state\": \"refused\"",
         "password"},
        {"small --json", [&] { RandomFile(Sender().SharePath("small") + "/big", 1u << 20); }, 9,
         "No space left on device", "\"rsync_errors\": ["},
        // An emptied folder, or a volume that should be a mount point and is not: what lies
        // there is not the share, and would wipe the receiver's copy.
        {"docs --json", emptied, 12, "--allow-empty-source", "\"guard\": \"empty-source\""},
        // The first share is checked while the server is tested: its verdict is not the next's.
        {"media docs --json", emptied, 12, "--allow-empty-source", "\"guard\": \"empty-source\""},
        {"docs --allow-empty-source", nullptr, 0, ""},
        {"media --json --allow-empty-source", unmounted, 12, "",
         "\"guard\": \"volume-not-mounted\""},
        // No serial number, and no MAC address in this network: no client ID.
        {"media", [&] { Sender().WriteHostConf(""); }, 1, "no client ID could be found"},
        {"media --max-delete 29%", threeDeleted, 13, "would delete 3 entries of the receiver's 10"},
        {"media --max-delete 30%", nullptr, 0, ""},
        {"media --json", [&] { pair_->Stop(); }, 5, "the server did not answer: socket-io (10)",
         "\"result\": \"unreachable\"", "[ERROR]"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE("exit " + std::to_string(row.status) + ": " + row.args);
        from = &Sender();
        password = options_.password;
        chmod(tmp.c_str(), 0700);
        copy = Copy("docs");
        if (row.before) {
            row.before();
        }
        const ProgramResult r = from->Run("s2s", Args(row.args), "", {{"S2S_PASSWORD", password}});
        EXPECT_EQ(r.status, row.status) << r.All();
        EXPECT_NE(r.err.find(row.err), std::string::npos) << r.err;
        EXPECT_NE(r.out.find(row.out), std::string::npos) << r.out;
        EXPECT_TRUE(row.absent.empty() || r.All().find(row.absent) == std::string::npos) << r.All();
        if (row.status == 0) {
            EXPECT_EQ(Copy("docs"), s2s_test::TreeManifest(docs));
            EXPECT_EQ(Copy("media"), s2s_test::TreeManifest(media));
            EXPECT_NE(Status().find("share: docs bound to SN-SENDER-0001, last sync completed"),
                      std::string::npos);
        } else {
            EXPECT_EQ(Copy("docs"), copy) << "the receiver's copy changed";
        }
    }
    EXPECT_EQ(Status().find("small bound to SN-SENDER-0001, last sync completed"),
              std::string::npos)
        << "a share whose copy failed was marked complete";
}

// Ctrl-C stops the copy: exit 130, no rsync left on either side, nothing marked complete.
TEST_F(Sync, CtrlCStopsTheCopyAndMarksNothingComplete) {
    ASSERT_EQ(pair_->Start(), "");
    const std::string big = Sender().SharePath("docs") + "/big.bin";
    RandomFile(big, 48u << 20);
    // Limited to 16 MiB/s, the copy cannot end before its partial file has been seen.
    const std::string pw = Sender().Root() + "/pw";
    WriteFile(pw, options_.password + "\n");
    chmod(pw.c_str(), 0600);
    std::vector<std::string> argv =
        Args("docs media --compress --json --max-bandwidth 16384 --password-file " + pw);
    argv.insert(argv.begin(), s2s_test::ToolPath("s2s"));
    s2s_test::Program sync(argv, Sender().Env());
    const std::string copy = pair_->Receiver().SharePath("docs");
    ASSERT_TRUE(s2s_test::WaitFor(  // rsync's temporary file sorts first
        [&] {
            const auto tree = s2s_test::TreeManifest(copy);
            return !tree.empty() && tree.begin()->first[1] == '.';
        },
        std::chrono::seconds(60)));
    // The sending rsync is frozen: stopping the run must not depend on its cooperation.
    pid_t rsync = -1;
    std::ifstream children("/proc/" + std::to_string(sync.Pid()) + "/task/" +
                           std::to_string(sync.Pid()) + "/children");
    ASSERT_TRUE(children >> rsync);
    kill(rsync, SIGSTOP);
    kill(sync.Pid(), SIGINT);
    const ProgramResult r = sync.Wait();
    EXPECT_EQ(r.status, 130) << r.All();
    EXPECT_NE(r.err.find("stopped by Ctrl-C"), std::string::npos) << r.err;
    EXPECT_NE(r.out.find("\"state\": \"cancelled\""), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("\"state\": \"not-run\""), std::string::npos) << r.out;
    EXPECT_NE(kill(rsync, 0), 0) << "the sending rsync outlived the run";
    // No rsync on the receiving side either: its temporary file is gone with it.
    EXPECT_TRUE(s2s_test::WaitFor([&] {
        return s2s_test::RunProgram({"/usr/bin/pgrep", "-f", big}).status == 1;
    }));
    EXPECT_EQ(Status().find("last sync completed"), std::string::npos);
}

}  // namespace
