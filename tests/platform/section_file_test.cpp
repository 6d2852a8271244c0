// Section files on real files: the format, every read and write function, refusal of what the
// format cannot carry, failed and interrupted writes, and concurrent writers in real processes.
#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "platform/platform_test_util.h"
#include "platform/section_file.h"
#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

using s2s_test::LogCapture;
using s2s_test::ReadFile;
using s2s_test::Table;
using s2s_test::TempDir;
using s2s_test::WriteFile;

std::vector<std::string> Sections(const std::string& file) {
    VLIBSzList* list = VLIBCSzListAlloc(8);
    std::vector<std::string> names;
    if (VLIBCFileEnumSection(file.c_str(), &list) >= 0) {
        for (int i = 0; i < VLIBCSzListCount(list); ++i) {
            names.push_back(VLIBCSzListGet(list, i));
        }
    }
    VLIBCSzListFree(list);
    return names;
}

// Names of leftover temporary files next to `file`.
int Leftovers(const TempDir& dir) {
    int count = 0;
    DIR* d = opendir(dir.path().c_str());
    while (dirent* e = readdir(d)) {
        count += std::string(e->d_name).find(".s2stmp-") != std::string::npos ? 1 : 0;
    }
    closedir(d);
    return count;
}

TEST(SectionFile, WritesTheFixedPairFormatAndReadsItBack) {
    TempDir dir;
    std::string file = dir / "store.info";
    Table pairs({{"clientID", "ABC123"}, {"serverName", "nas-1"}});
    ASSERT_EQ(VLIBCFileAddSection(file.c_str(), "PairedClientInfo", pairs.get(), "\t%s=\"%s\"\n"),
              1);
    EXPECT_EQ(ReadFile(file),
              "[PairedClientInfo]\n\tclientID=\"ABC123\"\n\tserverName=\"nas-1\"\n");

    Table out;
    EXPECT_EQ(VLIBCFileGetSection(file.c_str(), "PairedClientInfo", out.ptr()), 1);
    EXPECT_EQ(out["clientID"], "ABC123");
    EXPECT_EQ(out["serverName"], "nas-1");
    EXPECT_EQ(VLIBCSzHashCount(out.get()), 2);

    char buf[36];
    EXPECT_EQ(
        VLIBCFileGetSectionValue(file.c_str(), "PairedClientInfo", "clientID", buf, sizeof(buf)),
        6);
    EXPECT_STREQ(buf, "ABC123");
}

TEST(SectionFile, AbsentSectionsAndKeysReportError0x2200) {
    TempDir dir;
    std::string file = dir / "store.info";
    WriteFile(file, "[SHARE_a]\n\tRunningID=\"x\"\n");
    Table out;
    EXPECT_EQ(VLIBCFileGetSection(file.c_str(), "SHARE_b", out.ptr()), 0);
    EXPECT_EQ(VLIBCErrGet(), 0x2200);
    char buf[36] = "junk";
    EXPECT_LT(VLIBCFileGetSectionValue(file.c_str(), "SHARE_a", "CompleteID", buf, sizeof(buf)), 0);
    EXPECT_EQ(VLIBCErrGet(), 0x2200);
    EXPECT_STREQ(buf, "");
    EXPECT_LT(VLIBCFileGetSectionValue(file.c_str(), "SHARE_b", "RunningID", buf, sizeof(buf)), 0);
    EXPECT_EQ(VLIBCErrGet(), 0x2200);
    // An empty existing section is found, not absent.
    WriteFile(file, "[empty]\n");
    EXPECT_EQ(VLIBCFileGetSection(file.c_str(), "empty", out.ptr()), 1);
}

TEST(SectionFile, ValueLongerThanTheBufferIsAnErrorNotATruncation) {
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file, "[s]\n\tk=\"0123456789\"\n");
    char buf[10];
    EXPECT_LT(VLIBCFileGetSectionValue(file.c_str(), "s", "k", buf, sizeof(buf)), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BUFFER_TOO_SMALL);
    char fits[11];
    EXPECT_EQ(VLIBCFileGetSectionValue(file.c_str(), "s", "k", fits, sizeof(fits)), 10);
}

TEST(SectionFile, SetReplacesNamedKeysKeepsOthersAndAppendsNewOnes) {
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file,
              "# kept comment\n[PairedClientInfo]\n\ts2sEnabled=\"yes\"\n\tclientID=\"old\"\n\n"
              "[TASK_1]\n\tstatus=\"idle\"\n");
    Table values({{"clientID", "new"}, {"serverName", "srv"}});
    ASSERT_EQ(VLIBCFileSetSection(file.c_str(), "PairedClientInfo", nullptr, values.get(),
                                  "\t%s=\"%s\"\n"),
              1);
    EXPECT_EQ(ReadFile(file),
              "# kept comment\n[PairedClientInfo]\n\ts2sEnabled=\"yes\"\n\tclientID=\"new\"\n"
              "\tserverName=\"srv\"\n\n[TASK_1]\n\tstatus=\"idle\"\n");
    EXPECT_EQ(VLIBCErrGet(), 0);
}

TEST(SectionFile, SetWithOldNameRenamesAndRefusesToCreateDuplicates) {
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file, "[a]\n\tk=\"1\"\n[b]\n\tk=\"2\"\n");
    Table values({{"x", "y"}});
    ASSERT_EQ(VLIBCFileSetSection(file.c_str(), "c", "a", values.get(), nullptr), 1);
    EXPECT_EQ(Sections(file), (std::vector<std::string>{"c", "b"}));
    std::string before = ReadFile(file);
    EXPECT_LT(VLIBCFileSetSection(file.c_str(), "b", "c", values.get(), nullptr), 0);
    EXPECT_EQ(ReadFile(file), before);
    // An absent section is appended.
    ASSERT_EQ(VLIBCFileSetSection(file.c_str(), "d", nullptr, values.get(), nullptr), 1);
    EXPECT_EQ(Sections(file), (std::vector<std::string>{"c", "b", "d"}));
}

TEST(SectionFile, AddOnAnExistingSectionDoesNotDuplicateIt) {
    TempDir dir;
    std::string file = dir / "f";
    Table first({{"ServerName", "one"}});
    Table second({{"ServerName", "two"}});
    ASSERT_EQ(VLIBCFileAddSection(file.c_str(), "CLIENTID_x", first.get(), nullptr), 1);
    ASSERT_EQ(VLIBCFileAddSection(file.c_str(), "CLIENTID_x", second.get(), nullptr), 1);
    EXPECT_EQ(ReadFile(file), "[CLIENTID_x]\n\tServerName=\"two\"\n");
}

TEST(SectionFile, ModifyUpdatesInPlaceAndReportsAbsentSectionWithZero) {
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file, "[PairedClientInfo]\n\tclientID=\"a\"\n\ts2sEnabled=\"yes\"\n");
    Table values({{"clientID", "S2SMULTI-SRC-SUPPORT"}, {"serverName", "S2SMULTI-SRC-SUPPORT"}});
    EXPECT_EQ(VLIBCIFileModifySection(file.c_str(), "PairedClientInfo", nullptr, values.get(), 1,
                                      nullptr),
              1);
    EXPECT_EQ(ReadFile(file),
              "[PairedClientInfo]\n\tclientID=\"S2SMULTI-SRC-SUPPORT\"\n\ts2sEnabled=\"yes\"\n"
              "\tserverName=\"S2SMULTI-SRC-SUPPORT\"\n");

    std::string before = ReadFile(file);
    EXPECT_EQ(VLIBCIFileModifySection(file.c_str(), "Other", nullptr, values.get(), 1, nullptr), 0);
    EXPECT_EQ(VLIBCErrGet(), 0x2200);
    EXPECT_EQ(ReadFile(file), before);

    // Without addKeys, keys the section lacks are left out.
    Table extra({{"clientID", "b"}, {"newKey", "v"}});
    EXPECT_EQ(VLIBCIFileModifySection(file.c_str(), "PairedClientInfo", "Renamed", extra.get(), 0,
                                      nullptr),
              1);
    Table out;
    EXPECT_EQ(VLIBCFileGetSection(file.c_str(), "Renamed", out.ptr()), 1);
    EXPECT_EQ(out["clientID"], "b");
    EXPECT_EQ(out["newKey"], "<absent>");
}

TEST(SectionFile, ReplaceRemoveAndEnumerate) {
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file, "[a]\n\tk1=\"1\"\n\tk2=\"2\"\n[b]\n\tk=\"x\"\n");
    Table values({{"k3", "3"}});
    ASSERT_EQ(VLIBCFileReplaceSection(file.c_str(), "a", values.get(), nullptr), 1);
    EXPECT_EQ(ReadFile(file), "[a]\n\tk3=\"3\"\n[b]\n\tk=\"x\"\n");
    EXPECT_EQ(VLIBCFileRemoveSection(file.c_str(), "a"), 1);
    EXPECT_EQ(ReadFile(file), "[b]\n\tk=\"x\"\n");
    EXPECT_EQ(VLIBCFileRemoveSection(file.c_str(), "a"), 0);
    EXPECT_EQ(VLIBCErrGet(), 0x2200);

    VLIBSzList* list = VLIBCSzListAlloc(4);
    VLIBCSzListPush(&list, "already");
    EXPECT_EQ(VLIBCFileEnumSection(file.c_str(), &list), 1);
    EXPECT_EQ(VLIBCSzListCount(list), 2);  // appended, not cleared
    EXPECT_STREQ(VLIBCSzListGet(list, 1), "b");
    VLIBCSzListFree(list);
}

TEST(SectionFile, ReadsHandWrittenVariants) {
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
}

TEST(SectionFile, ValuesWithQuotesAndOddBytesReadBackUnchanged) {
    TempDir dir;
    std::string file = dir / "f";
    const char* tricky = "say \"hi\" = \\ ; # [x] \"";
    const char* spaced = "  padded\t";
    const char* latin1_name = "caf\xe9";  // not UTF-8: stored as bytes
    Table values({{"q", tricky}, {"s", spaced}, {"e", ""}});
    ASSERT_EQ(VLIBCFileAddSection(file.c_str(), latin1_name, values.get(), nullptr), 1);
    Table out;
    ASSERT_EQ(VLIBCFileGetSection(file.c_str(), latin1_name, out.ptr()), 1);
    EXPECT_EQ(out["q"], tricky);
    EXPECT_EQ(out["s"], spaced);
    EXPECT_EQ(out["e"], "");
}

TEST(SectionFile, RefusesWhatTheFormatCannotCarryWithoutTouchingTheFile) {
    LogCapture log;
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file, "[s]\n\tk=\"v\"\n");
    std::string before = ReadFile(file);
    std::string too_long(VLIB_SECTION_VALUE_MAX + 1, 'x');
    std::string longest(VLIB_SECTION_VALUE_MAX, 'x');
    struct Case {
        const char* section;
        const char* key;
        const char* value;
    } cases[] = {{"s", "k", "two\nlines"}, {"s", "k", "cr\r"}, {"s", "a=b", "v"},
                 {"s", " k", "v"},         {"s", "#k", "v"},   {"s\n", "k", "v"},
                 {" s", "k", "v"},         {"", "k", "v"},     {"s", "k", too_long.c_str()}};
    for (const Case& c : cases) {
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
    EXPECT_LT(VLIBCFileAddSection(file.c_str(), "t", nullptr, nullptr), 0);
}

TEST(SectionFile, MalformedFilesFailClearlyAndAreNeverRewritten) {
    LogCapture log;
    TempDir dir;
    std::string file = dir / "f";
    const std::string garbage[] = {
        "[s]\n\tk=\"v\"\nthis is not a pair\n",
        "orphan=\"before any section\"\n[s]\n",
        "[s]\n\tk=\"unterminated\n",
        "[]\n",
        std::string("[s]\n\tk=\"v\0x\"\n", 12),
        "[s]\n\tk=\"" + std::string(70000, 'y') + "\"\n",
    };
    for (const std::string& content : garbage) {
        WriteFile(file, content);
        Table out;
        EXPECT_LT(VLIBCFileGetSection(file.c_str(), "s", out.ptr()), 0);
        EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_FORMAT);
        Table values({{"k", "new"}});
        EXPECT_LT(VLIBCFileSetSection(file.c_str(), "s", nullptr, values.get(), nullptr), 0);
        EXPECT_LT(VLIBCFileAddSection(file.c_str(), "t", values.get(), nullptr), 0);
        EXPECT_LT(VLIBCFileRemoveSection(file.c_str(), "s"), 0);
        EXPECT_EQ(ReadFile(file), content);
    }
    EXPECT_TRUE(log.Contains("Malformed line 3 in section file '" + file + "'"));
}

TEST(SectionFile, MissingAndUnreadableFiles) {
    LogCapture log;
    TempDir dir;
    std::string missing = dir / "missing";
    Table out;
    EXPECT_LT(VLIBCFileGetSection(missing.c_str(), "s", out.ptr()), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_FILE_NOT_FOUND);
    VLIBSzList* list = VLIBCSzListAlloc(1);
    EXPECT_LT(VLIBCFileEnumSection(missing.c_str(), &list), 0);
    VLIBCSzListFree(list);
    EXPECT_LT(VLIBCIFileModifySection(missing.c_str(), "s", nullptr, out.get(), 1, nullptr), 0);
    EXPECT_EQ(VLIBCFileExist(missing.c_str()), 0);

    // A directory where the file should be cannot be read (even by root).
    std::string dir_instead = dir / "isdir";
    ASSERT_EQ(mkdir(dir_instead.c_str(), 0755), 0);
    EXPECT_LT(VLIBCFileGetSection(dir_instead.c_str(), "s", out.ptr()), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_IO);
    EXPECT_TRUE(log.Contains("Fail to read section file '" + dir_instead + "'"));
    EXPECT_EQ(VLIBCFileExist(dir_instead.c_str()), 0);

    // Writers create a missing file, with mode 0644 (before umask).
    Table values({{"k", "v"}});
    mode_t old_mask = umask(022);
    EXPECT_EQ(VLIBCFileAddSection(missing.c_str(), "s", values.get(), nullptr), 1);
    umask(old_mask);
    struct stat st;
    ASSERT_EQ(stat(missing.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0644u);
    EXPECT_EQ(VLIBCFileExist(missing.c_str()), 1);
}

TEST(SectionFile, RewriteKeepsModeAndFollowsSymlinks) {
    TempDir dir;
    std::string real = dir / "real.conf";
    std::string link = dir / "link.conf";
    WriteFile(real, "[s]\n");
    ASSERT_EQ(chmod(real.c_str(), 0640), 0);
    ASSERT_EQ(symlink(real.c_str(), link.c_str()), 0);
    Table values({{"k", "v"}});
    ASSERT_EQ(VLIBCFileSetSection(link.c_str(), "s", nullptr, values.get(), nullptr), 1);
    struct stat st;
    ASSERT_EQ(lstat(link.c_str(), &st), 0);
    EXPECT_TRUE(S_ISLNK(st.st_mode));
    ASSERT_EQ(stat(real.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0640u);
    EXPECT_EQ(ReadFile(real), "[s]\n\tk=\"v\"\n");
}

// Each step of a replacement fails once on purpose: the old file must survive byte for byte, and
// no temporary file may stay behind.
TEST(SectionFile, AFailedWriteKeepsTheOldContent) {
    LogCapture log;
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file, "[s]\n\tk=\"old\"\n");
    const std::string before = ReadFile(file);
    for (const char* failing : {"write", "fsync", "rename"}) {
        std::string wanted(failing);
        s2s_platform::SetSectionWriteFault(
            [&](const char* step) { return wanted == step ? ENOSPC : 0; });
        Table values({{"k", "new"}});
        EXPECT_LT(VLIBCFileSetSection(file.c_str(), "s", nullptr, values.get(), nullptr), 0)
            << failing;
        EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_IO);
        EXPECT_EQ(ReadFile(file), before) << failing;
        EXPECT_EQ(Leftovers(dir), 0) << failing;
        EXPECT_TRUE(log.Contains("Fail to " + wanted + " the new content of"));
    }
    s2s_platform::SetSectionWriteFault(nullptr);
    Table values({{"k", "new"}});
    EXPECT_EQ(VLIBCFileSetSection(file.c_str(), "s", nullptr, values.get(), nullptr), 1);
    EXPECT_EQ(ReadFile(file), "[s]\n\tk=\"new\"\n");
}

// Writers in separate processes each add their own keys to one section many times; the flock
// around each read-modify-write must keep every key.
TEST(SectionFile, ConcurrentWritersInSeparateProcessesLoseNoUpdate) {
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file, "[counter]\n");
    constexpr int kWriters = 4;
    constexpr int kWrites = 40;
    std::vector<pid_t> children;
    for (int w = 0; w < kWriters; ++w) {
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            int failures = 0;
            for (int i = 0; i < kWrites; ++i) {
                VLIBSzHash* values = VLIBCSzHashAlloc(1);
                std::string key = "w" + std::to_string(w) + "_" + std::to_string(i);
                VLIBCSzHashSetValue(&values, key.c_str(), "1");
                failures +=
                    VLIBCFileSetSection(file.c_str(), "counter", nullptr, values, nullptr) == 1 ? 0
                                                                                                : 1;
                VLIBCSzHashFree(values);
            }
            _exit(failures == 0 ? 0 : 1);
        }
        children.push_back(pid);
    }
    for (pid_t pid : children) {
        int status = 0;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }
    Table out;
    ASSERT_EQ(VLIBCFileGetSection(file.c_str(), "counter", out.ptr()), 1);
    EXPECT_EQ(VLIBCSzHashCount(out.get()), kWriters * kWrites);
    EXPECT_EQ(Leftovers(dir), 0);
}

void DrainEvents(int watch) {
    char buf[4096];
    while (read(watch, buf, sizeof(buf)) > 0) {
    }
}

// Waits (up to 10 s) for the creation of a writer's temporary file in the watched directory.
bool WaitForTemporary(int watch) {
    for (;;) {
        struct pollfd pfd = {watch, POLLIN, 0};
        if (poll(&pfd, 1, 10000) != 1) {
            return false;
        }
        alignas(struct inotify_event) char buf[4096];
        ssize_t n = read(watch, buf, sizeof(buf));
        for (ssize_t at = 0; at < n;) {
            const auto* event = reinterpret_cast<const struct inotify_event*>(buf + at);
            if (event->len > 0 && std::strstr(event->name, ".s2stmp-") != nullptr) {
                return true;
            }
            at += static_cast<ssize_t>(sizeof(struct inotify_event) + event->len);
        }
    }
}

// A writer process is killed at random moments in the middle of rewriting a large file. After
// every kill the file must parse, and each section must be one whole generation: every key of a
// section carries the same generation number, which a torn or half-merged write would break.
TEST(SectionFile, WriterKilledMidUpdateNeverLeavesATornFile) {
    TempDir dir;
    std::string file = dir / "crash.info";
    std::mt19937 rng(12345);
    constexpr int kSections = 6;
    constexpr int kKeys = 40;
    constexpr int kRounds = 60;
    const std::string padding(300, 'p');
    int last_seen_generation = -1;
    int killed_mid_replacement = 0;
    int watch = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    ASSERT_GE(watch, 0);
    ASSERT_GE(inotify_add_watch(watch, dir.path().c_str(), IN_CREATE), 0);
    for (int round = 0; round < kRounds; ++round) {
        int progress[2];
        ASSERT_EQ(pipe(progress), 0);
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            close(progress[0]);
            for (int generation = round * 100000;; ++generation) {
                VLIBSzHash* values = VLIBCSzHashAlloc(kKeys);
                for (int k = 0; k < kKeys; ++k) {
                    std::string key = "key" + std::to_string(k);
                    std::string value = std::to_string(generation) + ":" + padding;
                    VLIBCSzHashSetValue(&values, key.c_str(), value.c_str());
                }
                std::string section = "SECTION_" + std::to_string(generation % kSections);
                if (VLIBCFileSetSection(file.c_str(), section.c_str(), nullptr, values, nullptr) !=
                    1) {
                    _exit(2);
                }
                VLIBCSzHashFree(values);
                char tick = 1;
                if (write(progress[1], &tick, 1) != 1) {
                    _exit(3);
                }
            }
        }
        close(progress[1]);
        // Let it complete a few writes, then kill it: in even rounds shortly after it created
        // the temporary file of a replacement (so inside one for sure), in odd rounds at a
        // random moment of its cycle.
        int wanted = 1 + static_cast<int>(rng() % 4);
        for (int got = 0; got < wanted;) {
            char tick;
            ssize_t n = read(progress[0], &tick, 1);
            ASSERT_EQ(n, 1) << "writer died on its own in round " << round;
            ++got;
        }
        if (round % 2 == 0) {
            DrainEvents(watch);
            ASSERT_TRUE(WaitForTemporary(watch)) << "round " << round;
            usleep(rng() % 300);
        } else {
            usleep(rng() % 1500);
        }
        kill(pid, SIGKILL);
        int status = 0;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        close(progress[0]);
        ASSERT_TRUE(WIFSIGNALED(status)) << "writer failed in round " << round;
        killed_mid_replacement += Leftovers(dir) > 0 ? 1 : 0;

        std::vector<std::string> names = Sections(file);
        ASSERT_FALSE(names.empty()) << "round " << round;
        for (const std::string& name : names) {
            Table out;
            ASSERT_EQ(VLIBCFileGetSection(file.c_str(), name.c_str(), out.ptr()), 1);
            ASSERT_EQ(VLIBCSzHashCount(out.get()), kKeys) << name << " round " << round;
            std::string first = out["key0"];
            std::string generation = first.substr(0, first.find(':'));
            for (int k = 0; k < kKeys; ++k) {
                std::string key = "key" + std::to_string(k);
                ASSERT_EQ(out[key.c_str()], generation + ":" + padding)
                    << name << " round " << round;
            }
            last_seen_generation = std::max(last_seen_generation, std::stoi(generation));
        }
    }
    EXPECT_GE(last_seen_generation, (kRounds - 1) * 100000);
    close(watch);
    // The kills must really have landed inside replacements (a temporary file was in flight).
    EXPECT_GE(killed_mid_replacement, kRounds / 4) << killed_mid_replacement;
    // The next writer clears what killed writers left behind.
    Table values({{"k", "v"}});
    ASSERT_EQ(VLIBCFileSetSection(file.c_str(), "final", nullptr, values.get(), nullptr), 1);
    EXPECT_EQ(Leftovers(dir), 0);
}

// --- the per-process read cache ---------------------------------------------------

std::string ValueOf(const std::string& file, const char* section, const char* key) {
    char buf[64];
    if (VLIBCFileGetSectionValue(file.c_str(), section, key, buf, sizeof(buf)) < 0) {
        return "<error " + std::to_string(VLIBCErrGet()) + ">";
    }
    return buf;
}

// Gives the file the modification time `when` exactly, so that neither size nor mtime differ.
void SetMtime(const std::string& file, const struct timespec& when) {
    struct timespec times[2] = {when, when};
    ASSERT_EQ(utimensat(AT_FDCWD, file.c_str(), times, 0), 0);
}

// Runs `body` in a child process and expects it to succeed.
template <typename Body>
void InChild(Body body) {
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        _exit(body() ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
}

// Overwrites the file's bytes where it stands, as an editor saving in place would.
bool RewriteInPlace(const std::string& file, const std::string& content) {
    int fd = open(file.c_str(), O_WRONLY | O_CLOEXEC);
    bool ok = fd >= 0 &&
              pwrite(fd, content.data(), content.size(), 0) == static_cast<ssize_t>(content.size());
    return fd >= 0 && close(fd) == 0 && ok;
}

// Another process rewrites the file between two reads of this one, keeping its size and (put
// back by hand) its mtime to the nanosecond: the second read must see the new content. By rename,
// as every writer does, many times in a row so that freed inode numbers come back; and in place.
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
        InChild([&] {
            Table values({{"k", value}});
            return VLIBCFileSetSection(file.c_str(), "s", nullptr, values.get(), nullptr) == 1;
        });
        SetMtime(file, first.st_mtim);
        struct stat now;
        ASSERT_EQ(stat(file.c_str(), &now), 0);
        ASSERT_EQ(now.st_size, first.st_size);
        ASSERT_EQ(ValueOf(file, "s", "k"), value) << "round " << round;
    }
    for (int round = 1; round <= 20; ++round) {
        std::string value = std::string(4, static_cast<char>('a' + round));
        InChild([&] { return RewriteInPlace(file, "[s]\n\tk=\"" + value + "\"\n"); });
        SetMtime(file, first.st_mtim);
        ASSERT_EQ(ValueOf(file, "s", "k"), value) << "round " << round;
        ASSERT_EQ(Sections(file), std::vector<std::string>{"s"});
    }
    // Edits right after a read may fall within the same tick of the file system's clock (where
    // the kernel does not hand out finer change times to files whose times were just looked at),
    // so that even the change time stays as it was.
    for (int round = 0; round < 200; ++round) {
        std::string value = std::to_string(1000 + round);
        ASSERT_TRUE(RewriteInPlace(file, "[s]\n\tk=\"" + value + "\"\n"));
        SetMtime(file, first.st_mtim);
        ASSERT_EQ(ValueOf(file, "s", "k"), value) << "round " << round;
    }
}

// A file left alone for a while is trusted on stat() alone; an edit in place must still show
// through the change time it stamps, even with size and mtime as they were.
TEST(SectionFile, CachedCopyOfASettledFileStillSeesAnEditInPlace) {
    TempDir dir;
    std::string file = dir / "host.conf";
    WriteFile(file, "[s]\n\tk=\"old\"\n");
    struct stat first;
    ASSERT_EQ(stat(file.c_str(), &first), 0);
    // Only the passing of time settles a file; nothing else can be waited for here.
    std::this_thread::sleep_for(std::chrono::milliseconds(1100));
    ASSERT_EQ(ValueOf(file, "s", "k"), "old");
    ASSERT_EQ(ValueOf(file, "s", "k"), "old");
    InChild([&] { return RewriteInPlace(file, "[s]\n\tk=\"new\"\n"); });
    SetMtime(file, first.st_mtim);
    EXPECT_EQ(ValueOf(file, "s", "k"), "new");
    // Made unreadable in place: the read fails as it would without a cache.
    WriteFile(file, "[s]\n\tk=\"new\"\nnot a pair\n");
    SetMtime(file, first.st_mtim);
    EXPECT_EQ(ValueOf(file, "s", "k"), "<error " + std::to_string(VLIB_ERR_BAD_FORMAT) + ">");
}

// Failures are never cached: each read of a malformed file is refused and logged again, and a
// read of a removed file reports it missing.
TEST(SectionFile, EveryReadOfAMalformedFileIsRefusedAndLogged) {
    LogCapture log;
    TempDir dir;
    std::string file = dir / "f";
    WriteFile(file, "[s]\n\tk=\"v\"\n");
    ASSERT_EQ(ValueOf(file, "s", "k"), "v");
    WriteFile(file, "[s]\ngarbage\n");
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(ValueOf(file, "s", "k"), "<error " + std::to_string(VLIB_ERR_BAD_FORMAT) + ">");
    }
    std::string text = log.Text();
    std::string line = "Malformed line 2 in section file '" + file + "'";
    size_t count = 0;
    for (size_t at = text.find(line); at != std::string::npos; at = text.find(line, at + 1)) {
        ++count;
    }
    EXPECT_EQ(count, 3u);
    WriteFile(file, "[s]\n\tk=\"w\"\n");
    EXPECT_EQ(ValueOf(file, "s", "k"), "w");
    ASSERT_EQ(unlink(file.c_str()), 0);
    EXPECT_EQ(ValueOf(file, "s", "k"), "<error " + std::to_string(VLIB_ERR_FILE_NOT_FOUND) + ">");
}

// Threads of one process share the cache while one of them writes: every read sees one whole
// version of the section, and versions never go backwards for a reader.
TEST(SectionFile, ThreadsReadingWhileOneWritesSeeWholeVersions) {
    TempDir dir;
    std::string file = dir / "f";
    ASSERT_EQ(
        VLIBCFileAddSection(file.c_str(), "s", Table({{"a", "0"}, {"b", "0"}}).get(), nullptr), 1);
    std::atomic<bool> done{false};
    std::atomic<int> failures{0};
    std::vector<std::thread> readers;
    for (int t = 0; t < 3; ++t) {
        readers.emplace_back([&] {
            int last = 0;
            while (!done.load()) {
                Table out;
                if (VLIBCFileGetSection(file.c_str(), "s", out.ptr()) != 1 ||
                    out["a"] != out["b"] || std::stoi(out["a"]) < last) {
                    ++failures;
                    return;
                }
                last = std::stoi(out["a"]);
            }
        });
    }
    for (int i = 1; i <= 40; ++i) {
        std::string n = std::to_string(i);
        Table values({{"a", n.c_str()}, {"b", n.c_str()}});
        if (VLIBCFileSetSection(file.c_str(), "s", nullptr, values.get(), nullptr) != 1) {
            ADD_FAILURE() << "write " << i;
            break;
        }
    }
    done = true;
    for (auto& reader : readers) {
        reader.join();
    }
    EXPECT_EQ(failures.load(), 0);
    EXPECT_EQ(ValueOf(file, "s", "a"), "40");
}

}  // namespace
