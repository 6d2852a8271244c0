// Helpers shared by the tests: temporary directories, free loopback ports, environment overrides,
// bounded waits and whole-file reads.
#ifndef S2S_TESTS_SUPPORT_TEST_UTIL_H
#define S2S_TESTS_SUPPORT_TEST_UTIL_H

#include <chrono>
#include <functional>
#include <string>

namespace s2s_test {

// A fresh directory under $TMPDIR (or /tmp), removed with everything inside on destruction.
class TempDir {
  public:
    explicit TempDir(const std::string& prefix = "s2s-test");
    ~TempDir();
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::string& path() const { return path_; }
    std::string operator/(const std::string& name) const { return path_ + "/" + name; }

  private:
    std::string path_;
};

// Sets (or unsets, with a null value) one environment variable for the object's lifetime.
class ScopedEnv {
  public:
    ScopedEnv(const std::string& name, const char* value);
    ~ScopedEnv();
    ScopedEnv(const ScopedEnv&) = delete;
    ScopedEnv& operator=(const ScopedEnv&) = delete;

  private:
    std::string name_;
    bool had_old_;
    std::string old_;
};

// A TCP port on 127.0.0.1 that was free a moment ago (the kernel picks it).
int FreeTcpPort();

// Polls `done` until it returns true or `limit` passes; true when it came true.
bool WaitFor(const std::function<bool()>& done,
             std::chrono::milliseconds limit = std::chrono::seconds(10));

std::string ReadFile(const std::string& path);
void WriteFile(const std::string& path, const std::string& content);
// Removes a tree (no error when it is missing).
void RemoveTree(const std::string& path);

}  // namespace s2s_test

#endif  // S2S_TESTS_SUPPORT_TEST_UTIL_H
