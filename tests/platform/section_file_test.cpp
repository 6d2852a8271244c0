// Section files on real files: the format, every read and write function (one table), refusal of
// what the format cannot carry, the read cache, writers in several processes, and every step of a
// replacement failing or its writer dying there (through a fault-injecting Env).
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "s2s_platform.h"
#include "support/fault_env.h"
#include "support/test_util.h"

namespace {

using s2s_platform::ReplaceStep;
using s2s_test::FaultEnv;
using s2s_test::LogCapture;
using s2s_test::ReadFile;
using s2s_test::Table;
using s2s_test::TempDir;
using s2s_test::WriteFile;

// How many temporary files of replacements are left in `dir`.
int Leftovers(const TempDir& dir) {
    int count = 0;
    DIR* d = opendir(dir.path().c_str());
    while (dirent* e = readdir(d)) {
        count += std::string(e->d_name).find(".s2stmp-") != std::string::npos ? 1 : 0;
    }
    closedir(d);
    return count;
}

// The exit status of child `pid` once it has ended; -1 when a signal ended it.
int ExitStatus(pid_t pid) {
    int status = 0;
    return waitpid(pid, &status, 0) != pid ? -2 : WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST(SectionFile, WritesTheFixedPairFormatAndReadsValuesAbsenceAndShortBuffers) {
    TempDir dir;
    std::string file = dir / "store.info";
    Table pairs({{"clientID", "ABC123"}, {"serverName", "nas-1"}});
    ASSERT_EQ(VLIBCFileAddSection(file.c_str(), "PairedClientInfo", pairs.get(), "\t%s=\"%s\"\n"),
              1);
    EXPECT_EQ(ReadFile(file),
              "[PairedClientInfo]\n\tclientID=\"ABC123\"\n\tserverName=\"nas-1\"\n");
    Table out;
    EXPECT_EQ(VLIBCFileGetSection(file.c_str(), "PairedClientInfo", out.ptr()), 1);
    EXPECT_EQ(VLIBCSzHashCount(out.get()), 2);
    // Absent sections and keys report error 0x2200; a value longer than the buffer is an error,
    // not a truncation.
    EXPECT_EQ(VLIBCFileGetSection(file.c_str(), "SHARE_b", out.ptr()), 0);
    EXPECT_EQ(VLIBCErrGet(), 0x2200);
    char buf[7] = "junk";
    EXPECT_LT(VLIBCFileGetSectionValue(file.c_str(), "PairedClientInfo", "x", buf, 7), 0);
    EXPECT_EQ(VLIBCErrGet(), 0x2200);
    EXPECT_STREQ(buf, "");
    EXPECT_EQ(VLIBCFileGetSectionValue(file.c_str(), "PairedClientInfo", "clientID", buf, 7), 6);
    EXPECT_STREQ(buf, "ABC123");
    EXPECT_LT(VLIBCFileGetSectionValue(file.c_str(), "PairedClientInfo", "clientID", buf, 6), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BUFFER_TOO_SMALL);
    // An empty existing section is found, not absent.
    WriteFile(file, "[empty]\n");
    EXPECT_EQ(VLIBCFileGetSection(file.c_str(), "empty", out.ptr()), 1);
}

// Each writer on a file: what it returns, the platform error, and the whole file afterwards.
TEST(SectionFile, WritersEditOnlyWhatTheyNameAndKeepTheRest) {
    const std::string base = "# kept\n[a]\n\tk=\"1\"\n\tx=\"old\"\n\n[b]\n\tk=\"2\"\n";
    const Table xy({{"x", "new"}, {"y", "add"}});
    struct Case {
        const char* what;
        std::function<int(const char*)> write;
        int result;
        int error;
        std::string after;
    } cases[] = {
        {"set replaces named keys and appends new ones",
         [&](const char* f) { return VLIBCFileSetSection(f, "a", nullptr, xy.get(), nullptr); }, 1,
         0, "# kept\n[a]\n\tk=\"1\"\n\tx=\"new\"\n\ty=\"add\"\n\n[b]\n\tk=\"2\"\n"},
        {"set with an old name renames",
         [&](const char* f) { return VLIBCFileSetSection(f, "c", "b", xy.get(), nullptr); }, 1, 0,
         "# kept\n[a]\n\tk=\"1\"\n\tx=\"old\"\n\n[c]\n\tk=\"2\"\n\tx=\"new\"\n\ty=\"add\"\n"},
        {"set refuses to rename onto another section",
         [&](const char* f) { return VLIBCFileSetSection(f, "a", "b", xy.get(), nullptr); }, -1,
         VLIB_ERR_BAD_PARAMETER, base},
        {"add on an existing section does not duplicate it",
         [&](const char* f) { return VLIBCFileAddSection(f, "b", xy.get(), nullptr); }, 1, 0,
         "# kept\n[a]\n\tk=\"1\"\n\tx=\"old\"\n\n[b]\n\tk=\"2\"\n\tx=\"new\"\n\ty=\"add\"\n"},
        {"modify without addKeys renames and leaves out missing keys",
         [&](const char* f) { return VLIBCIFileModifySection(f, "a", "r", xy.get(), 0, nullptr); },
         1, 0, "# kept\n[r]\n\tk=\"1\"\n\tx=\"new\"\n\n[b]\n\tk=\"2\"\n"},
        {"modify reports an absent section with 0",
         [&](const char* f) {
             return VLIBCIFileModifySection(f, "z", nullptr, xy.get(), 1, nullptr);
         },
         0, 0x2200, base},
        {"replace drops the section's other keys",
         [&](const char* f) { return VLIBCFileReplaceSection(f, "a", xy.get(), nullptr); }, 1, 0,
         "# kept\n[a]\n\tx=\"new\"\n\ty=\"add\"\n\n[b]\n\tk=\"2\"\n"},
        {"remove of an absent section",
         [&](const char* f) { return VLIBCFileRemoveSection(f, "z"); }, 0, 0x2200, base},
        {"remove", [&](const char* f) { return VLIBCFileRemoveSection(f, "a"); }, 1, 0,
         "# kept\n[b]\n\tk=\"2\"\n"},
    };
    TempDir dir;
    std::string file = dir / "f";
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        WriteFile(file, base);
        EXPECT_EQ(c.write(file.c_str()), c.result);
        EXPECT_EQ(VLIBCErrGet(), c.error);
        EXPECT_EQ(ReadFile(file), c.after);
    }
    // Enumeration appends to the list it is given.
    VLIBSzList* list = VLIBCSzListAlloc(4);
    VLIBCSzListPush(&list, "already");
    EXPECT_EQ(VLIBCFileEnumSection(file.c_str(), &list), 1);
    EXPECT_EQ(VLIBCSzListCount(list), 2);
    EXPECT_STREQ(VLIBCSzListGet(list, 1), "b");
    VLIBCSzListFree(list);
}

TEST(SectionFile, ReadsHandWrittenVariantsAndOddValuesBackUnchanged) {
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file,
              "; comment\r\n  [ spaced ]  \r\nplain = unquoted value \r\n\tq=\"\"\r\n"
              "dup=\"first\"\ndup=\"second\"\n");
    Table out;
    ASSERT_EQ(VLIBCFileGetSection(file.c_str(), "spaced", out.ptr()), 1);
    EXPECT_EQ(out["plain"], "unquoted value");
    EXPECT_EQ(out["q"], "");
    EXPECT_EQ(out["dup"], "first");
    const char* tricky = "say \"hi\" = \\ ; # [x] \"";
    const char* latin1_name = "caf\xe9";  // not UTF-8: stored as bytes
    Table values({{"q", tricky}, {"s", "  padded\t"}});
    ASSERT_EQ(VLIBCFileAddSection(file.c_str(), latin1_name, values.get(), nullptr), 1);
    ASSERT_EQ(VLIBCFileGetSection(file.c_str(), latin1_name, out.ptr()), 1);
    EXPECT_EQ(out["q"], tricky);
    EXPECT_EQ(out["s"], "  padded\t");
}

TEST(SectionFile, RefusesWhatTheFormatCannotCarryWithoutTouchingTheFile) {
    LogCapture log;
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file, "[s]\n\tk=\"v\"\n");
    std::string before = ReadFile(file);
    std::string too_long(VLIB_SECTION_VALUE_MAX + 1, 'x');
    std::string longest(VLIB_SECTION_VALUE_MAX, 'x');
    struct {
        const char *section, *key, *value;
    } cases[] = {{"s", "k", "two\nlines"}, {"s", "k", "cr\r"}, {"s", "a=b", "v"},
                 {"s", " k", "v"},         {"s", "#k", "v"},   {"s\n", "k", "v"},
                 {" s", "k", "v"},         {"", "k", "v"},     {"s", "k", too_long.c_str()}};
    for (const auto& c : cases) {
        Table values({{c.key, c.value}});
        EXPECT_LT(VLIBCFileSetSection(file.c_str(), c.section, nullptr, values.get(), nullptr), 0)
            << c.section << "/" << c.key;
        EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_PARAMETER);
        EXPECT_LT(VLIBCFileAddSection(file.c_str(), c.section, values.get(), nullptr), 0);
        EXPECT_LT(VLIBCFileReplaceSection(file.c_str(), c.section, values.get(), nullptr), 0);
    }
    EXPECT_EQ(ReadFile(file), before);
    EXPECT_TRUE(log.Contains("[ERROR] section_file.cpp("));

    Table ok({{"k", longest.c_str()}});
    EXPECT_EQ(VLIBCFileSetSection(file.c_str(), "s", nullptr, ok.get(), nullptr), 1);
    // Only the one fixed line format is accepted.
    EXPECT_LT(VLIBCFileAddSection(file.c_str(), "t", ok.get(), "%s=%s\n"), 0);
}

TEST(SectionFile, MalformedFilesFailClearlyAndAreNeverRewritten) {
    LogCapture log;
    TempDir dir;
    std::string file = dir / "f";
    const std::string garbage[] = {"[s]\n\tk=\"v\"\nthis is not a pair\n",
                                   "orphan=\"before any section\"\n[s]\n",
                                   "[s]\n\tk=\"unterminated\n",
                                   "[]\n",
                                   std::string("[s]\n\tk=\"v\0x\"\n", 12),
                                   "[s]\n\tk=\"" + std::string(70000, 'y') + "\"\n"};
    for (const std::string& content : garbage) {
        WriteFile(file, content);
        Table out;
        EXPECT_LT(VLIBCFileGetSection(file.c_str(), "s", out.ptr()), 0);
        EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_FORMAT);
        EXPECT_LT(VLIBCFileRemoveSection(file.c_str(), "s"), 0);
        EXPECT_LT(VLIBCFileGetSection(file.c_str(), "s", out.ptr()), 0);
        EXPECT_EQ(ReadFile(file), content);
    }
    // Each refusal is logged anew: a failure is never cached.
    std::string text = log.Text(), line = "Malformed line 3 in section file '" + file + "'";
    size_t logged = 0;
    for (size_t at = text.find(line); at != std::string::npos; at = text.find(line, at + 1)) {
        ++logged;
    }
    EXPECT_EQ(logged, 3u);
}

TEST(SectionFile, MissingAndUnreadableFilesModesAndLinks) {
    LogCapture log;
    TempDir dir;
    std::string missing = dir / "missing";
    Table out;
    EXPECT_LT(VLIBCFileGetSection(missing.c_str(), "s", out.ptr()), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_FILE_NOT_FOUND);
    // A directory where the file should be cannot be read (even by root).
    std::string dir_instead = dir / "isdir";
    ASSERT_EQ(mkdir(dir_instead.c_str(), 0755), 0);
    EXPECT_LT(VLIBCFileGetSection(dir_instead.c_str(), "s", out.ptr()), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_IO);
    EXPECT_TRUE(log.Contains("Fail to read section file '" + dir_instead + "'"));
    // Writers create a missing file with mode 0644 (before umask); a rewrite keeps the mode and
    // replaces the file a symbolic link names, not the link.
    mode_t old_mask = umask(022);
    EXPECT_EQ(VLIBCFileAddSection(missing.c_str(), "s", Table({{"k", "v"}}).get(), nullptr), 1);
    umask(old_mask);
    struct stat st;
    ASSERT_EQ(stat(missing.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0644u);
    std::string link = dir / "link.conf";
    ASSERT_EQ(chmod(missing.c_str(), 0640), 0);
    ASSERT_EQ(symlink(missing.c_str(), link.c_str()), 0);
    ASSERT_EQ(VLIBCFileSetSection(link.c_str(), "s", nullptr, Table({{"k", "w"}}).get(), nullptr),
              1);
    ASSERT_EQ(stat(missing.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0640u);
    EXPECT_EQ(ReadFile(missing), "[s]\n\tk=\"w\"\n");
}

// Writers in separate processes each add their own keys to one section; the flock around each
// read-modify-write must keep every key. Threads of this process read meanwhile through the one
// shared cache: every read must succeed, and the count of keys never go back.
TEST(SectionFile, WritersInSeparateProcessesLoseNoUpdateWhileThreadsRead) {
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file, "[counter]\n");
    constexpr int kWriters = 4;
    constexpr int kWrites = 30;
    std::vector<pid_t> children;
    for (int w = 0; w < kWriters; ++w) {
        children.push_back(fork());
        ASSERT_GE(children.back(), 0);
        if (children.back() == 0) {
            bool ok = true;
            for (int i = 0; i < kWrites; ++i) {
                std::string key = "w" + std::to_string(w) + "_" + std::to_string(i);
                Table values({{key.c_str(), "1"}});
                ok = ok && VLIBCFileSetSection(file.c_str(), "counter", nullptr, values.get(),
                                               nullptr) == 1;
            }
            _exit(ok ? 0 : 1);
        }
    }
    std::atomic<bool> done{false};
    std::atomic<int> bad_reads{0};
    std::vector<std::thread> readers;
    for (int t = 0; t < 3; ++t) {
        readers.emplace_back([&] {
            for (int last = 0; !done.load();) {
                Table out;
                bool read = VLIBCFileGetSection(file.c_str(), "counter", out.ptr()) == 1;
                int count = read ? VLIBCSzHashCount(out.get()) : -1;
                bad_reads += count < last ? 1 : 0;
                last = std::max(last, count);
            }
        });
    }
    for (pid_t pid : children) {
        EXPECT_EQ(ExitStatus(pid), 0);
    }
    done = true;
    for (std::thread& reader : readers) {
        reader.join();
    }
    EXPECT_EQ(bad_reads.load(), 0);
    Table out;
    ASSERT_EQ(VLIBCFileGetSection(file.c_str(), "counter", out.ptr()), 1);
    EXPECT_EQ(VLIBCSzHashCount(out.get()), kWriters * kWrites);
}

// Every step of a replacement: the line its failure logs, and whether the file holds the new
// content (else the old) when that step fails or when the writer dies right after it.
struct StepCase {
    ReplaceStep step;
    const char* failure_log;
    bool new_after_failure, new_after_death;
};
const StepCase kSteps[] = {
    {ReplaceStep::kCreate, "Fail to create a temporary file in", false, false},
    {ReplaceStep::kWrite, "Fail to write the new content of", false, false},
    {ReplaceStep::kSync, "Fail to fsync the new content of", false, false},
    {ReplaceStep::kRename, "Fail to rename the new content of", false, true},
    {ReplaceStep::kSyncDir, "[WARNING] section_file.cpp(", true, true},
};

// Writes a version large enough to take several (shortened) writes: two keys, 3000 times `c`.
int SetBig(const std::string& file, char c) {
    std::string value(3000, c);
    Table values({{"a", value.c_str()}, {"b", value.c_str()}});
    return VLIBCFileSetSection(file.c_str(), "s", nullptr, values.get(), nullptr);
}

// Whether the file reads as wholly the version written with `c`.
bool Holds(const std::string& file, char c) {
    Table out;
    return VLIBCFileGetSection(file.c_str(), "s", out.ptr()) == 1 &&
           out["a"] == std::string(3000, c) && out["b"] == out["a"];
}

// For each step: failed, the old content stays (the new one once renamed) and no temporary file
// remains; died after it (in a forked writer), the file is wholly old or wholly new.
TEST(SectionFileCrash, EveryStepFailedOrDiedAfterLeavesTheOldOrTheNewFileWhole) {
    LogCapture log;
    TempDir dir;
    std::string file = dir / "f";
    for (const StepCase& c : kSteps) {
        SCOPED_TRACE(s2s_platform::ReplaceStepName(c.step));
        // The write removes what a writer that died at the previous step left.
        ASSERT_EQ(SetBig(file, 'o'), 1);
        EXPECT_EQ(Leftovers(dir), 0);
        {
            FaultEnv env;
            env.ShortWrites(1000);
            // The third write of a multi-write content, the first call of every other step.
            env.FailNth(c.step, c.step == ReplaceStep::kWrite ? 3 : 1, ENOSPC);
            s2s_platform::EnvOverride use(&env);
            EXPECT_EQ(SetBig(file, 'n'), c.new_after_failure ? 1 : -1);
            EXPECT_EQ(VLIBCErrGet(), c.new_after_failure ? 0 : VLIB_ERR_IO);
        }
        EXPECT_TRUE(Holds(file, c.new_after_failure ? 'n' : 'o'));
        EXPECT_EQ(Leftovers(dir), 0);
        EXPECT_TRUE(log.Contains(c.failure_log));

        ASSERT_EQ(SetBig(file, 'o'), 1);
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            FaultEnv env;
            env.ShortWrites(1000);
            env.DieAfter(c.step);
            s2s_platform::EnvOverride use(&env);
            _exit(SetBig(file, 'n'));
        }
        ASSERT_EQ(ExitStatus(pid), FaultEnv::kDiedStatus);
        EXPECT_TRUE(Holds(file, c.new_after_death ? 'n' : 'o'));
    }
}

std::string ValueOf(const std::string& file, const char* section, const char* key) {
    char buf[64];
    int got = VLIBCFileGetSectionValue(file.c_str(), section, key, buf, sizeof(buf));
    return got < 0 ? "<error " + std::to_string(VLIBCErrGet()) + ">" : std::string(buf);
}

// Gives the file the modification time `when` exactly, so that neither size nor mtime differ.
void SetMtime(const std::string& file, const struct timespec& when) {
    struct timespec times[2] = {when, when};
    ASSERT_EQ(utimensat(AT_FDCWD, file.c_str(), times, 0), 0);
}

// Runs `body` in a child process; true when it succeeded there.
template <typename Body>
bool InChild(Body body) {
    pid_t pid = fork();
    if (pid == 0) {
        _exit(body() ? 0 : 1);
    }
    return pid > 0 && ExitStatus(pid) == 0;
}

// Overwrites the file's bytes where it stands, as an editor saving in place would.
bool RewriteInPlace(const std::string& file, const std::string& content) {
    int fd = open(file.c_str(), O_WRONLY | O_CLOEXEC);
    bool ok = fd >= 0 &&
              pwrite(fd, content.data(), content.size(), 0) == static_cast<ssize_t>(content.size());
    return fd >= 0 && close(fd) == 0 && ok;
}

// Another process rewrites the file between two reads of this one, keeping its size and mtime
// (put back by hand): the second read must see the new content. By rename, as writers do, many
// times so that freed inode numbers come back; and in place right after a read, within one tick
// of the file system's clock, so that even the change time may stay as it was.
TEST(SectionFile, CachedReadsNeverServeStaleContent) {
    TempDir dir;
    std::string file = dir / "store.info";
    ASSERT_EQ(VLIBCFileAddSection(file.c_str(), "s", Table({{"k", "0000"}}).get(), nullptr), 1);
    struct stat first;
    ASSERT_EQ(stat(file.c_str(), &first), 0);
    ASSERT_EQ(ValueOf(file, "s", "k"), "0000");
    for (int round = 1; round <= 60; ++round) {
        char value[8];
        snprintf(value, sizeof(value), "%04d", round);
        ASSERT_TRUE(InChild([&] {
            Table values({{"k", value}});
            return VLIBCFileSetSection(file.c_str(), "s", nullptr, values.get(), nullptr) == 1;
        }));
        SetMtime(file, first.st_mtim);
        ASSERT_EQ(ValueOf(file, "s", "k"), value) << "round " << round;
    }
    for (int round = 0; round < 200; ++round) {
        std::string value = std::to_string(1000 + round);
        ASSERT_TRUE(RewriteInPlace(file, "[s]\n\tk=\"" + value + "\"\n"));
        SetMtime(file, first.st_mtim);
        ASSERT_EQ(ValueOf(file, "s", "k"), value) << "round " << round;
    }
    // A file left alone for a while is trusted on stat() alone; an edit in place must still show
    // through the change time it stamps. The clock is moved on rather than waited for.
    FaultEnv later;
    later.ShiftClock(std::chrono::seconds(5));
    s2s_platform::EnvOverride use(&later);
    ASSERT_EQ(ValueOf(file, "s", "k"), "1199");
    ASSERT_EQ(ValueOf(file, "s", "k"), "1199");
    ASSERT_TRUE(InChild([&] { return RewriteInPlace(file, "[s]\n\tk=\"abcd\"\n"); }));
    SetMtime(file, first.st_mtim);
    EXPECT_EQ(ValueOf(file, "s", "k"), "abcd");
    // Made unreadable in place: the read fails as it would without a cache.
    WriteFile(file, "[s]\n\tk=\"new\"\nnot a pair\n");
    SetMtime(file, first.st_mtim);
    EXPECT_EQ(ValueOf(file, "s", "k"), "<error " + std::to_string(VLIB_ERR_BAD_FORMAT) + ">");
}

}  // namespace
