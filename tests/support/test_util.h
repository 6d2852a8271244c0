// Small helpers for every test: temporary directories, environment overrides, free ports, waits,
// files, the library's log captured, a platform string table from literals, a child process.
#ifndef S2S_TESTS_SUPPORT_TEST_UTIL_H
#define S2S_TESTS_SUPPORT_TEST_UTIL_H

#include <stdlib.h>
#include <sys/types.h>
#include <chrono>
#include <functional>
#include <optional>
#include <stdexcept>
#include <string>
#include "s2s_logger.h"
#include "s2s_platform.h"

namespace s2s_test {

struct NoCopy {
    NoCopy() = default;
    NoCopy(const NoCopy&) = delete;
    NoCopy& operator=(const NoCopy&) = delete;
};

// Polls `done` until it returns true or `limit` passes; true when it came true.
bool WaitFor(const std::function<bool()>& done,
             std::chrono::milliseconds limit = std::chrono::seconds(10));
int FreeTcpPort();  // on 127.0.0.1, free a moment ago (the kernel picks it)
std::string ReadFile(const std::string& path);
void WriteFile(const std::string& path, const std::string& content);
void MakeDirs(const std::string& path, mode_t mode = 0755);  // and its parents; throws on failure
void RemoveTree(const std::string& path);                    // quietly, even when missing

// A fresh directory under $TMPDIR (or /tmp), removed with everything inside on destruction.
class TempDir : NoCopy {
  public:
    explicit TempDir(const std::string& prefix = "s2s-test") {
        const char* base = getenv("TMPDIR");
        path_ = std::string(base != nullptr && *base ? base : "/tmp") + "/" + prefix + ".XXXXXX";
        if (mkdtemp(path_.data()) == nullptr) {
            throw std::runtime_error("mkdtemp failed for " + path_);
        }
    }
    ~TempDir() { RemoveTree(path_); }
    const std::string& path() const { return path_; }
    std::string operator/(const std::string& name) const { return path_ + "/" + name; }

  private:
    std::string path_;
};

// Sets (or unsets, with a null value) one environment variable for the object's lifetime.
class ScopedEnv : NoCopy {
  public:
    ScopedEnv(const std::string& name, const char* value) : name_(name) {
        if (const char* old = getenv(name.c_str())) {
            old_ = old;
        }
        value != nullptr ? setenv(name.c_str(), value, 1) : unsetenv(name.c_str());
    }
    ~ScopedEnv() { old_ ? setenv(name_.c_str(), old_->c_str(), 1) : unsetenv(name_.c_str()); }

  private:
    std::string name_;
    std::optional<std::string> old_;
};

// The library's log sent to a private file while it lives; then errors go to standard error.
class LogCapture : NoCopy {
  public:
    explicit LogCapture(int level = S2S::Logger::Debug) {
        S2S::Logger::Initialize(S2S::Logger::File, level, dir_ / "log", 2);
    }
    ~LogCapture() {
        S2S::Logger::Destroy();
        S2S::Logger::Initialize(S2S::Logger::Stderr, S2S::Logger::Error, "", 0);
    }
    std::string Text() const { return ReadFile(dir_ / "log"); }
    bool Contains(const std::string& needle) const {
        return Text().find(needle) != std::string::npos;
    }

  private:
    TempDir dir_{"s2s-log"};
};

// An owned platform string table filled from literals.
class Table : NoCopy {
  public:
    Table(std::initializer_list<std::pair<const char*, std::string>> pairs = {})
        : hash_(VLIBCSzHashAlloc(16)) {
        for (const auto& pair : pairs) {
            VLIBCSzHashSetValue(&hash_, pair.first, pair.second.c_str());
        }
    }
    ~Table() { VLIBCSzHashFree(hash_); }
    VLIBSzHash* get() const { return hash_; }
    VLIBSzHash** ptr() { return &hash_; }
    std::string operator[](const char* key) const {
        const char* value = VLIBCSzHashGetValue(hash_, key);
        return value == nullptr ? "<absent>" : value;
    }

  private:
    VLIBSzHash* hash_;
};

// `body` run in a forked child whose exit code is its result (120 when it throws). A child still
// running when the object goes is killed and reaped. Children make no gtest assertions.
class Child : NoCopy {
  public:
    explicit Child(const std::function<int()>& body);
    ~Child() { Wait(std::chrono::milliseconds(0)); }
    pid_t pid() const { return pid_; }
    // Once: the exit code, -1 when a signal ended it, -2 when it did not end by `limit` (killed).
    int Wait(std::chrono::milliseconds limit = std::chrono::seconds(60));

  private:
    pid_t pid_;
};

}  // namespace s2s_test

#endif  // S2S_TESTS_SUPPORT_TEST_UTIL_H
