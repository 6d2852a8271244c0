// Helpers for the platform and host tests: capturing the library's log in a file, and building
// string tables in one line.
#ifndef S2S_TESTS_PLATFORM_PLATFORM_TEST_UTIL_H
#define S2S_TESTS_PLATFORM_PLATFORM_TEST_UTIL_H

#include <initializer_list>
#include <string>
#include <utility>

#include "s2s_logger.h"
#include "s2s_platform.h"
#include "support/test_util.h"

namespace s2s_test {

// Sends the library's log (all levels) to a file for the object's lifetime.
class LogCapture {
  public:
    LogCapture() : dir_("s2s-log") {
        S2S::Logger::Initialize(S2S::Logger::File, S2S::Logger::Debug, dir_ / "log", 2);
    }
    ~LogCapture() { S2S::Logger::Destroy(); }
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    std::string Text() const { return ReadFile(dir_ / "log"); }
    bool Contains(const std::string& needle) const {
        return Text().find(needle) != std::string::npos;
    }

  private:
    TempDir dir_;
};

// An owned string table filled from pairs.
class Table {
  public:
    Table(std::initializer_list<std::pair<const char*, const char*>> pairs = {})
        : hash_(VLIBCSzHashAlloc(16)) {
        for (const auto& pair : pairs) {
            VLIBCSzHashSetValue(&hash_, pair.first, pair.second);
        }
    }
    ~Table() { VLIBCSzHashFree(hash_); }
    Table(const Table&) = delete;
    Table& operator=(const Table&) = delete;

    VLIBSzHash* get() const { return hash_; }
    VLIBSzHash** ptr() { return &hash_; }
    std::string operator[](const char* key) const {
        const char* value = VLIBCSzHashGetValue(hash_, key);
        return value == nullptr ? "<absent>" : value;
    }

  private:
    VLIBSzHash* hash_;
};

}  // namespace s2s_test

#endif  // S2S_TESTS_PLATFORM_PLATFORM_TEST_UTIL_H
