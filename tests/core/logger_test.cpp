// Logger, through its interface and what it writes: syslog by default, stamped file lines, the
// rotation after one mebibyte written (not counting the file's old size) keeping one file fewer
// than the count, a failed reopen, Destroy's fallback, bare lines for unknown kinds, and whole
// lines under concurrent writers.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdarg>
#include <cstdio>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "s2s_logger.h"
#include "support/test_util.h"

using S2S::Logger;

// The test program's own vsyslog takes the place of the C library's, so the lines the logger
// hands to syslog and their priority can be checked.
static std::vector<std::pair<int, std::string>> g_syslog;

extern "C" void vsyslog(int priority, const char* format, va_list args) {
    char text[1024];
    std::vsnprintf(text, sizeof(text), format, args);
    g_syslog.emplace_back(priority, text);
}

namespace {
const std::regex kStampedLine(
    R"([A-Z][a-z]{2} [ 0-9]\d \d\d:\d\d:\d\d \[ERROR\] x\.cpp\(\d+\): .*\n)");
// Each case is its own process under CTest; this one must also run first in a plain run.
TEST(Logger, DefaultGoesToSyslogAsErrorAndTheLevelOnlyFilters) {
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): first\n", 10);
    Logger::LogMsg(Logger::Warning, "[WARNING] x.cpp(%d): dropped\n", 11);
    ASSERT_EQ(Logger::Initialize(Logger::Syslog, 7, "", 0), 0);
    Logger::LogMsg(Logger::Debug, "[DEBUG] x.cpp(%d): detail\n", 12);
    EXPECT_EQ(
        decltype(g_syslog)({{3, "[ERROR] x.cpp(10): first\n"}, {3, "[DEBUG] x.cpp(12): detail\n"}}),
        g_syslog);
}

class LoggerFile : public ::testing::Test {
  protected:
    void TearDown() override {
        Logger::Destroy();
        Logger::Initialize(Logger::Stderr, Logger::Error, "", 0);
    }
    s2s_test::TempDir dir_{"s2s-logger"};
    std::string path_ = dir_ / "s2s.log";
};

TEST_F(LoggerFile, NeedsAWritablePathAndStampsAndFiltersLines) {
    EXPECT_EQ(Logger::Initialize(Logger::File, 7, "", 5), -1);
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): nowhere\n", 1);  // dropped, no crash
    EXPECT_EQ(Logger::Initialize(Logger::File, 7, dir_ / "missing/dir/log", 5), -1);
    // Any kind past the known ones is a file too.
    ASSERT_EQ(Logger::Initialize(static_cast<Logger::Type>(9), 5, path_, 4), 0);
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): value %s\n", 42, "v");
    Logger::LogMsg(Logger::Info, "[INFO] x.cpp(%d): filtered\n", 43);
    const std::string text = s2s_test::ReadFile(path_);
    EXPECT_TRUE(std::regex_match(text, kStampedLine)) << text;
    EXPECT_NE(text.find("[ERROR] x.cpp(42): value v\n"), std::string::npos);
}

TEST_F(LoggerFile, RotatesAfterTheMessageThatCrossesOneMebibyteKeepingOneFileFewerThanTheCount) {
    const std::string old(4096, 'x');  // an existing file's size is not counted
    s2s_test::WriteFile(path_, old + "\n");
    for (const char* name : {"_0", "_1", "_2"}) {
        s2s_test::WriteFile(path_ + name, name);
    }
    ASSERT_EQ(Logger::Initialize(Logger::File, 3, path_, 3), 0);
    const std::string filler(1000, 'f');
    int count = 0;
    while (s2s_test::ReadFile(path_ + "_1") != "_0" && count < 2000) {
        Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): %s\n", ++count, filler.c_str());
    }
    const std::string rotated = s2s_test::ReadFile(path_ + "_0");
    EXPECT_GT(rotated.size() - old.size() - 1, 1048576u);
    EXPECT_LT(rotated.size() - old.size() - 1, 1048576u + 1100);
    EXPECT_NE(rotated.find("x.cpp(" + std::to_string(count) + ")"), std::string::npos);
    EXPECT_NE(0, access((path_ + "_2").c_str(), F_OK));
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): fresh\n", ++count);
    EXPECT_TRUE(std::regex_match(s2s_test::ReadFile(path_), kStampedLine));  // that line alone
}

TEST_F(LoggerFile, FailedReopenSilencesFileLogging) {
    ASSERT_EQ(Logger::Initialize(Logger::File, 3, path_, 2), 0);
    ASSERT_EQ(unlink(path_.c_str()), 0);  // the rotation's rename fails
    EXPECT_EQ(Logger::Rotate(), -1);
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): lost\n", 1);
    EXPECT_NE(0, access(path_.c_str(), F_OK));
}

// s2sd reopens its log on SIGHUP after logrotate moved the file away.
TEST_F(LoggerFile, ReopenStartsAFreshFileAtThePathAfterItWasMoved) {
    EXPECT_EQ(Logger::Reopen(0640), -1);  // not in file mode
    ASSERT_EQ(Logger::Initialize(Logger::File, 3, path_, 5), 0);
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): before\n", 1);
    ASSERT_EQ(rename(path_.c_str(), (path_ + ".old").c_str()), 0);
    ASSERT_EQ(Logger::Reopen(0640), 0);
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): after\n", 2);
    EXPECT_NE(s2s_test::ReadFile(path_ + ".old").find("before"), std::string::npos);
    EXPECT_EQ(s2s_test::ReadFile(path_).find("before"), std::string::npos);
    EXPECT_NE(s2s_test::ReadFile(path_).find("after"), std::string::npos);
    struct stat st;
    ASSERT_EQ(stat(path_.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0640u);
}

TEST_F(LoggerFile, DestroyFallsBackToStampedStandardOutputAndUnknownKindsWriteBareLines) {
    ASSERT_EQ(Logger::Initialize(Logger::File, 7, path_, 9), 0);
    Logger::Destroy();
    ::testing::internal::CaptureStdout();
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): after destroy\n", 5);
    Logger::LogMsg(Logger::Debug, "[DEBUG] x.cpp(%d): filtered\n", 6);  // back at level error
    const std::string out = ::testing::internal::GetCapturedStdout();
    EXPECT_TRUE(std::regex_match(out, kStampedLine)) << out;
    EXPECT_EQ(s2s_test::ReadFile(path_), "");
    // A failed file initialisation keeps the old stream but the new kind: bare standard error.
    EXPECT_EQ(Logger::Initialize(static_cast<Logger::Type>(-1), 3, "", 0), -1);
    ::testing::internal::CaptureStderr();
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): bare\n", 7);
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), "[ERROR] x.cpp(7): bare\n");
}

TEST_F(LoggerFile, ConcurrentLinesNeverInterleave) {
    ASSERT_EQ(Logger::Initialize(Logger::File, 7, path_, 50), 0);
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t) {
        threads.emplace_back([t] {
            const std::string payload(64 + t * 13, static_cast<char>('a' + t));
            for (int i = 0; i < 2000; ++i) {
                Logger::LogMsg(Logger::Debug, "[DEBUG] x.cpp(%d): %d %s\n", t, i, payload.c_str());
            }
        });
    }
    for (auto& thread : threads) {
        thread.join();
    }
    std::string all = s2s_test::ReadFile(path_);
    for (int i = 0; i < 50; ++i) {
        all += s2s_test::ReadFile(path_ + "_" + std::to_string(i));
    }
    const std::regex line(R"(.{16}\[DEBUG\] x\.cpp\((\d)\): \d+ ([a-z])\2*\n)");
    size_t lines = 0, covered = 0;  // every byte belongs to a whole line
    for (std::sregex_iterator m(all.begin(), all.end(), line), end; m != end; ++m, ++lines) {
        ASSERT_EQ((*m)[2].str()[0], 'a' + std::stoi((*m)[1].str())) << m->str();
        covered += static_cast<size_t>(m->length());
    }
    EXPECT_EQ(lines, 8u * 2000u);
    EXPECT_EQ(covered, all.size());
}
}  // namespace
