#include <gtest/gtest.h>

#include <cstdarg>
#include <cstdio>
#include <regex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <sys/stat.h>
#include <unistd.h>

#include "s2s_logger.h"
#include "support/test_util.h"

using S2S::Logger;

namespace {

// The test program's own vsyslog takes the place of the C library's, so the lines the logger
// hands to syslog and their priority can be checked.
std::vector<std::pair<int, std::string>> g_syslog;

}  // namespace

extern "C" void vsyslog(int priority, const char* format, va_list args) {
    char text[1024];
    std::vsnprintf(text, sizeof(text), format, args);
    g_syslog.emplace_back(priority, text);
}

namespace {

class LoggerTest : public ::testing::Test {
  protected:
    void SetUp() override { Reset(); }
    void TearDown() override {
        if (Logger::log_type == Logger::File) {
            Logger::Destroy();  // closes the test's log file
        }
        Reset();
    }
    static void Reset() {
        Logger::Initialize(Logger::Syslog, 3, "", 0);  // no stream
        Logger::rotate_cnt = 50;
        g_syslog.clear();
    }
    s2s_test::TempDir dir_{"s2s-logger"};
};

const std::regex kStampedLine(
    R"([A-Z][a-z]{2} [ 0-9]\d \d\d:\d\d:\d\d \[ERROR\] x\.cpp\(\d+\): .*)");

std::vector<std::string> Lines(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) {
        lines.push_back(line);
    }
    return lines;
}

TEST_F(LoggerTest, DefaultGoesToSyslogAsErrorAndFilters) {
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): first\n", 10);
    Logger::LogMsg(Logger::Warning, "[WARNING] x.cpp(%d): dropped\n", 11);
    ASSERT_EQ(g_syslog.size(), 1u);
    EXPECT_EQ(g_syslog[0].first, 3);
    EXPECT_EQ(g_syslog[0].second, "[ERROR] x.cpp(10): first\n");

    // The level filters but never sets the priority: a debug line also goes out as an error.
    ASSERT_EQ(Logger::Initialize(Logger::Syslog, 7, "", 0), 0);
    Logger::LogMsg(Logger::Debug, "[DEBUG] x.cpp(%d): detail\n", 12);
    ASSERT_EQ(g_syslog.size(), 2u);
    EXPECT_EQ(g_syslog[1].first, 3);
}

TEST_F(LoggerTest, FileKindNeedsAPath) {
    EXPECT_EQ(Logger::Initialize(Logger::File, 7, "", 5), -1);
    EXPECT_EQ(Logger::log_type, Logger::File);
    EXPECT_EQ(Logger::log_level, 7);
    ::testing::internal::CaptureStdout();
    ::testing::internal::CaptureStderr();
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): nowhere\n", 1);  // dropped, no crash
    EXPECT_EQ(::testing::internal::GetCapturedStdout(), "");
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), "");
    EXPECT_TRUE(g_syslog.empty());

    EXPECT_EQ(Logger::Initialize(Logger::File, 7, dir_ / "missing/dir/log", 5), -1);
}

TEST_F(LoggerTest, UnknownKindBecomesFileAndStampsLines) {
    std::string path = dir_ / "s2s.log";
    ASSERT_EQ(Logger::Initialize(static_cast<Logger::Type>(9), 5, path, 4), 0);
    EXPECT_EQ(Logger::log_type, Logger::File);
    EXPECT_EQ(Logger::rotate_cnt, 4);
    EXPECT_EQ(Logger::log_size, 0);
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): value %s\n", 42, "v");
    Logger::LogMsg(Logger::Info, "[INFO] x.cpp(%d): filtered\n", 43);
    std::vector<std::string> lines = Lines(s2s_test::ReadFile(path));
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_TRUE(std::regex_match(lines[0], kStampedLine)) << lines[0];
    EXPECT_NE(lines[0].find("[ERROR] x.cpp(42): value v"), std::string::npos);
    EXPECT_EQ(Logger::log_size, static_cast<int>(lines[0].size() + 1));
}

TEST_F(LoggerTest, ExistingFileSizeIsNotCounted) {
    std::string path = dir_ / "s2s.log";
    s2s_test::WriteFile(path, std::string(4096, 'x') + "\n");
    ASSERT_EQ(Logger::Initialize(Logger::File, 3, path, 50), 0);
    EXPECT_EQ(Logger::log_size, 0);
}

TEST_F(LoggerTest, RotatesAfterTheMessageThatCrossesOneMebibyte) {
    std::string path = dir_ / "s2s.log";
    ASSERT_EQ(Logger::Initialize(Logger::File, 3, path, 3), 0);
    std::string filler(1000, 'f');
    int count = 0;
    int before = 0;
    do {
        before = Logger::log_size;
        Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): %s\n", ++count, filler.c_str());
    } while (Logger::log_size > before);
    EXPECT_GT(before, 1048576 - 1100);
    // The message that took the size past the limit is the last one of the old file.
    std::string last = "x.cpp(" + std::to_string(count) + ")";
    EXPECT_NE(s2s_test::ReadFile(path + "_0").find(last), std::string::npos);
    EXPECT_EQ(s2s_test::ReadFile(path), "");
    EXPECT_EQ(Logger::log_size, 0);
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): fresh\n", ++count);
    EXPECT_NE(s2s_test::ReadFile(path).find("fresh"), std::string::npos);
    EXPECT_EQ(s2s_test::ReadFile(path + "_0").find("fresh"), std::string::npos);
}

TEST_F(LoggerTest, RotationKeepsOneFewerFileThanTheCount) {
    std::string path = dir_ / "s2s.log";
    s2s_test::WriteFile(path + "_0", "zero");
    s2s_test::WriteFile(path + "_1", "one");
    s2s_test::WriteFile(path + "_2", "two");
    ASSERT_EQ(Logger::Initialize(Logger::File, 3, path, 3), 0);
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): current\n", 1);
    ASSERT_EQ(Logger::Rotate(), 0);
    EXPECT_NE(s2s_test::ReadFile(path + "_0").find("current"), std::string::npos);
    EXPECT_EQ(s2s_test::ReadFile(path + "_1"), "zero");
    EXPECT_FALSE(s2s_test::WaitFor([&] { return access((path + "_2").c_str(), F_OK) == 0; },
                                   std::chrono::milliseconds(0)));
    EXPECT_EQ(s2s_test::ReadFile(path), "");
}

TEST_F(LoggerTest, FailedReopenSilencesFileLogging) {
    std::string sub = dir_ / "sub";
    ASSERT_EQ(mkdir(sub.c_str(), 0700), 0);
    std::string path = sub + "/s2s.log";
    ASSERT_EQ(Logger::Initialize(Logger::File, 3, path, 2), 0);
    ASSERT_EQ(chmod(sub.c_str(), 0500), 0);
    if (access(path.c_str(), W_OK) == 0 && geteuid() == 0) {
        // root ignores the mode: make the rename fail by removing the file under the logger
        ASSERT_EQ(unlink(path.c_str()), 0);
    }
    EXPECT_EQ(Logger::Rotate(), -1);
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): lost\n", 1);
    EXPECT_EQ(s2s_test::ReadFile(path).find("lost"), std::string::npos);
    chmod(sub.c_str(), 0700);
}

TEST_F(LoggerTest, ReopenStartsAFreshFileAtThePathAfterItWasMoved) {
    std::string path = dir_ / "s2s.log";
    EXPECT_EQ(Logger::Reopen(0640), -1);  // not in file mode
    ASSERT_EQ(Logger::Initialize(Logger::File, 3, path, 5), 0);
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): before\n", 1);
    ASSERT_EQ(rename(path.c_str(), (path + ".old").c_str()), 0);
    ASSERT_EQ(Logger::Reopen(0640), 0);
    EXPECT_EQ(Logger::log_size, 0);
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): after\n", 2);
    EXPECT_NE(s2s_test::ReadFile(path + ".old").find("before"), std::string::npos);
    EXPECT_EQ(s2s_test::ReadFile(path).find("before"), std::string::npos);
    EXPECT_NE(s2s_test::ReadFile(path).find("after"), std::string::npos);
    struct stat st;
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0640u);
}

TEST_F(LoggerTest, DestroyFallsBackToStandardOutput) {
    ASSERT_EQ(Logger::Initialize(Logger::File, 7, dir_ / "s2s.log", 9), 0);
    Logger::Destroy();
    EXPECT_EQ(Logger::log_type, Logger::Stderr);
    EXPECT_EQ(Logger::log_level, 3);
    EXPECT_EQ(Logger::log_size, -1);
    EXPECT_EQ(Logger::rotate_cnt, 50);
    EXPECT_TRUE(Logger::log_path.empty());
    ::testing::internal::CaptureStdout();
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): after destroy\n", 5);
    std::string out = ::testing::internal::GetCapturedStdout();
    EXPECT_TRUE(std::regex_match(out.substr(0, out.size() - 1), kStampedLine)) << out;

    // Outside file mode Destroy does nothing.
    Logger::Initialize(Logger::Stdout, 6, "", 0);
    Logger::Destroy();
    EXPECT_EQ(Logger::log_type, Logger::Stdout);
    EXPECT_EQ(Logger::log_level, 6);
}

TEST_F(LoggerTest, KindOutsideTheKnownOnesWritesBareLinesToStandardError) {
    ASSERT_EQ(Logger::Initialize(Logger::Stdout, 3, "", 0), 0);
    // A failed file initialisation keeps the old stream but the new kind.
    EXPECT_EQ(Logger::Initialize(static_cast<Logger::Type>(-1), 3, "", 0), -1);
    ::testing::internal::CaptureStderr();
    Logger::LogMsg(Logger::Error, "[ERROR] x.cpp(%d): bare\n", 7);
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), "[ERROR] x.cpp(7): bare\n");
}

TEST_F(LoggerTest, ConcurrentLinesNeverInterleave) {
    std::string path = dir_ / "s2s.log";
    ASSERT_EQ(Logger::Initialize(Logger::File, 7, path, 50), 0);
    constexpr int kThreads = 8;
    constexpr int kLines = 2000;
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([t] {
            std::string payload(64 + t * 13, static_cast<char>('a' + t));
            for (int i = 0; i < kLines; ++i) {
                Logger::LogMsg(Logger::Debug, "[DEBUG] x.cpp(%d): %d %s\n", t, i, payload.c_str());
            }
        });
    }
    for (auto& thread : threads) {
        thread.join();
    }
    std::string all = s2s_test::ReadFile(path);
    for (int i = 0; i < 50; ++i) {
        all = s2s_test::ReadFile(path + "_" + std::to_string(i)) + all;
    }
    std::vector<std::string> lines = Lines(all);
    ASSERT_EQ(lines.size(), static_cast<size_t>(kThreads * kLines));
    const std::regex whole(R"(.{16}\[DEBUG\] x\.cpp\((\d)\): \d+ ([a-z])\2*)");
    for (const std::string& line : lines) {
        std::smatch m;
        ASSERT_TRUE(std::regex_match(line, m, whole)) << line;
        EXPECT_EQ(m[2].str()[0], 'a' + std::stoi(m[1].str()));
    }
}

}  // namespace
