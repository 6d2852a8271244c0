// Shared by the pairing store's tests: a store of its own under a temporary S2S_ROOT, tables built
// from literals, sections read back as maps, and the store's messages captured.
#ifndef S2S_TESTS_HOST_PAIRING_STORE_TEST_SUPPORT_H
#define S2S_TESTS_HOST_PAIRING_STORE_TEST_SUPPORT_H

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <initializer_list>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "host/pairing_store.h"
#include "s2s_platform.h"
#include "s2s_server.h"
#include "support/test_util.h"

namespace pairing_test {

using Pairs = std::map<std::string, std::string>;

// A platform table filled from literals, freed on destruction.
class Table {
  public:
    Table(std::initializer_list<std::pair<const char*, std::string>> pairs = {})
        : hash_(VLIBCSzHashAlloc(16)) {
        for (const auto& pair : pairs) {
            VLIBCSzHashSetValue(&hash_, pair.first, pair.second.c_str());
        }
    }
    ~Table() { VLIBCSzHashFree(hash_); }
    Table(const Table&) = delete;
    Table& operator=(const Table&) = delete;

    VLIBSzHash* get() const { return hash_; }
    VLIBSzHash** slot() { return &hash_; }
    Pairs ToMap() const {
        Pairs out;
        for (int i = 0; i < VLIBCSzHashCount(hash_); ++i) {
            out[VLIBCSzHashKeyAt(hash_, i)] = VLIBCSzHashValueAt(hash_, i);
        }
        return out;
    }

  private:
    VLIBSzHash* hash_;
};

// A platform string list, freed on destruction.
class List {
  public:
    List(std::initializer_list<std::string> items = {}) : list_(VLIBCSzListAlloc(16)) {
        for (const auto& item : items) {
            VLIBCSzListPush(&list_, item.c_str());
        }
    }
    ~List() { VLIBCSzListFree(list_); }
    List(const List&) = delete;
    List& operator=(const List&) = delete;

    VLIBSzList* get() const { return list_; }
    VLIBSzList** slot() { return &list_; }
    void Push(const std::string& item) { VLIBCSzListPush(&list_, item.c_str()); }
    std::vector<std::string> Items() const {
        std::vector<std::string> out;
        for (int i = 0; i < VLIBCSzListCount(list_); ++i) {
            out.push_back(VLIBCSzListGet(list_, i));
        }
        return out;
    }

  private:
    VLIBSzList* list_;
};

inline const char* StoreFile() {
    return S2SPath(S2S_PATH_PAIRING_STORE);
}

// The pairs of a section as the store reads them; `found` gets S2SGetServerInfo's result.
inline Pairs ReadSection(const std::string& section, int* found = nullptr) {
    Table table;
    int result = S2SGetServerInfo(section.c_str(), table.slot());
    if (found != nullptr) {
        *found = result;
    }
    return table.ToMap();
}

// Section names in file order; a failure to read the file gives {"<unreadable>"}.
inline std::vector<std::string> SectionNames() {
    List names;
    if (VLIBCFileEnumSection(StoreFile(), names.slot()) < 0) {
        return {"<unreadable>"};
    }
    return names.Items();
}

inline int Update(const std::string& section,
                  std::initializer_list<std::pair<const char*, std::string>> pairs) {
    Table table(pairs);
    return S2SUpdateServerInfo(section.c_str(), table.get());
}

// Every message the store sent while an instance lived.
class MessageCapture {
  public:
    MessageCapture() { previous_ = S2S::PairingStore::SetMessageSink(&Sink); }
    ~MessageCapture() {
        S2S::PairingStore::SetMessageSink(previous_);
        std::lock_guard<std::mutex> guard(Mutex());
        Messages().clear();
    }
    MessageCapture(const MessageCapture&) = delete;
    MessageCapture& operator=(const MessageCapture&) = delete;

    std::vector<std::string> Take() {
        std::lock_guard<std::mutex> guard(Mutex());
        std::vector<std::string> out;
        out.swap(Messages());
        return out;
    }

  private:
    static std::mutex& Mutex() {
        static std::mutex mutex;
        return mutex;
    }
    static std::vector<std::string>& Messages() {
        static std::vector<std::string> messages;
        return messages;
    }
    static void Sink(const char* message) {
        std::lock_guard<std::mutex> guard(Mutex());
        Messages().push_back(message);
    }

    S2S::PairingStore::MessageSink previous_;
};

// A root of its own: S2S_ROOT points at a temporary directory holding the store's directory
// (and /var/run for the rsync daemon's pid file). The store's file itself is not created.
// `inMemory` puts the root on /dev/shm when there is one: for tests that rewrite the file
// thousands of times and are about ordering, not about what reaches the disk.
class StoreRoot {
  public:
    explicit StoreRoot(bool inMemory = false)
        : root_(MakeRoot(inMemory)), env_("S2S_ROOT", root_->path().c_str()) {
        for (const char* dir : {"/usr", "/usr/vurn", "/usr/vurn/etc", "/var", "/var/run"}) {
            mkdir((root_->path() + dir).c_str(), 0755);
        }
    }
    const std::string& path() const { return root_->path(); }
    std::string Contents() const { return s2s_test::ReadFile(StoreFile()); }

  private:
    static std::unique_ptr<s2s_test::TempDir> MakeRoot(bool inMemory) {
        struct stat st;
        const bool shm = inMemory && stat("/dev/shm", &st) == 0 && S_ISDIR(st.st_mode) &&
                         access("/dev/shm", W_OK) == 0;
        s2s_test::ScopedEnv tmp("TMPDIR", shm ? "/dev/shm" : std::getenv("TMPDIR"));
        return std::make_unique<s2s_test::TempDir>("s2s-pairing");
    }

    std::unique_ptr<s2s_test::TempDir> root_;
    s2s_test::ScopedEnv env_;
};

// Runs `body` in a child process; the child's exit status is what `body` returns.
template <typename Body>
pid_t Spawn(Body body) {
    pid_t pid = fork();
    if (pid == 0) {
        _exit(body());
    }
    return pid;
}

// Waits for `pid` up to `limit`; its exit status, -1 when it was killed by a signal, or -2 when
// it is still running at the limit (it is then killed).
inline int WaitChild(pid_t pid, std::chrono::milliseconds limit = std::chrono::seconds(60)) {
    int status = 0;
    pid_t done = 0;
    bool finished = s2s_test::WaitFor(
        [&] {
            done = waitpid(pid, &status, WNOHANG);
            return done != 0;
        },
        limit);
    if (!finished) {
        kill(pid, SIGKILL);
        waitpid(pid, &status, 0);
        return -2;
    }
    if (done < 0) {
        return -3;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

}  // namespace pairing_test

#endif  // S2S_TESTS_HOST_PAIRING_STORE_TEST_SUPPORT_H
