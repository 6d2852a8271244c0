// The pairing store under real processes: many writers at once, writers killed at random points,
// and readers running beside the writers. Every process works on a store under its own
// temporary S2S_ROOT; the semaphore is the system's one, so tests running in parallel only wait
// for each other.
#include <dirent.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstring>
#include <new>
#include <random>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "tests/host/pairing_store_test_support.h"

namespace {

using pairing_test::List;
using pairing_test::Pairs;
using pairing_test::ReadSection;
using pairing_test::SectionNames;
using pairing_test::Spawn;
using pairing_test::StoreRoot;
using pairing_test::Table;
using pairing_test::Update;
using pairing_test::WaitChild;

constexpr const char* kMarker = "S2SMULTI-SRC-SUPPORT";

// Counters shared with child processes (an anonymous shared mapping; the atomics are lock-free,
// so they work across processes).
template <typename T>
class Shared {
  public:
    Shared() {
        void* memory =
            mmap(nullptr, sizeof(T), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
        if (memory == MAP_FAILED) {
            throw std::runtime_error("mmap failed");
        }
        value_ = new (memory) T();  // placement into the mapping; unmapped below
    }
    ~Shared() {
        value_->~T();
        munmap(value_, sizeof(T));
    }
    Shared(const Shared&) = delete;
    Shared& operator=(const Shared&) = delete;
    T* get() const { return value_; }
    T* operator->() const { return value_; }

  private:
    T* value_;
};

// The files in the store's directory.
std::vector<std::string> StoreDirectory(const StoreRoot& root) {
    std::vector<std::string> names;
    DIR* dir = opendir((root.path() + "/usr/vurn/etc").c_str());
    if (dir == nullptr) {
        return names;
    }
    while (dirent* entry = readdir(dir)) {
        if (strcmp(entry->d_name, ".") != 0 && strcmp(entry->d_name, "..") != 0) {
            names.push_back(entry->d_name);
        }
    }
    closedir(dir);
    std::sort(names.begin(), names.end());
    return names;
}

std::string Key(const char* prefix, int n) {
    return prefix + std::to_string(n);
}

// --- many writers -------------------------------------------------------------------------------

constexpr int kWriters = 16;
constexpr int kRounds = 200;
constexpr int kSwitchWriter = kWriters - 1;  // also flips "s2sEnabled" every round
constexpr int kResetWriter = 0;              // also converts the store now and then

// Which key of its own task section writer round `round` sets (several rounds share a key, so
// the last one must win).
std::string TaskKey(int round) {
    return Key("k", (round / 4) % 5);
}

int Writer(int id) {
    for (int round = 0; round < kRounds; ++round) {
        const std::string r = std::to_string(round);
        int result = 0;
        switch (round % 4) {
            case 0:  // the same section as everybody, a key of its own
                result = Update("SHARE_common", {{Key("w", id).c_str(), r}});
                break;
            case 1:  // a section of its own
                result = Update("TASK_" + Key("w", id), {{TaskKey(round).c_str(), r}, {"last", r}});
                break;
            case 2:  // the same key as everybody
                result = Update("SHARE_common", {{"shared", std::to_string(id) + ":" + r}});
                break;
            default:  // a new section
                result = Update(Key("CLIENTID_w", id) + "_r" + r, {{"ServerName", r}});
                break;
        }
        if (result != 0) {
            return 10 + round % 4;
        }
        if (round == kRounds / 4 && S2SServerUpdatePairInfo(Key("w", id).c_str(), "srv") != 0) {
            return 20;
        }
        if (id == kSwitchWriter && Update("PairedClientInfo", {{"s2sEnabled", "v" + r}}) != 0) {
            return 21;
        }
        if (id == kResetWriter && round % 50 == 10 && s2s_svr_reset_pair() != 0) {
            return 22;
        }
    }
    return 0;
}

TEST(PairingStoreStressTest, ConcurrentWritersLoseNoUpdateAndDuplicateNoSection) {
    StoreRoot root(/*inMemory=*/true);
    ASSERT_EQ(0, Update("PairedClientInfo",
                        {{"s2sEnabled", "yes"}, {"clientID", "old"}, {"serverName", "oldsrv"}}));

    std::vector<pid_t> writers;
    for (int id = 0; id < kWriters; ++id) {
        writers.push_back(Spawn([id] { return Writer(id); }));
    }
    for (int id = 0; id < kWriters; ++id) {
        EXPECT_EQ(0, WaitChild(writers[id], std::chrono::minutes(8))) << "writer " << id;
    }

    // Every section once, and exactly the sections written.
    std::vector<std::string> names = SectionNames();
    std::multiset<std::string> counted(names.begin(), names.end());
    std::set<std::string> unique(names.begin(), names.end());
    EXPECT_EQ(counted.size(), unique.size()) << "a section is duplicated";
    std::set<std::string> expected = {"PairedClientInfo", "SHARE_common", "CLIENTID_old",
                                      "CLIENTID_S2SMULTI-SRC-SUPPORT"};
    for (int id = 0; id < kWriters; ++id) {
        expected.insert("TASK_" + Key("w", id));
        expected.insert(Key("CLIENTID_w", id));
        for (int round = 3; round < kRounds; round += 4) {
            expected.insert(Key("CLIENTID_w", id) + "_r" + std::to_string(round));
        }
    }
    EXPECT_EQ(expected, unique);

    // Every writer's last value of every key.
    Pairs common = ReadSection("SHARE_common");
    for (int id = 0; id < kWriters; ++id) {
        EXPECT_EQ(std::to_string(kRounds - 4), common[Key("w", id)]) << id;
        Pairs task;
        for (int round = 1; round < kRounds; round += 4) {
            task[TaskKey(round)] = std::to_string(round);
            task["last"] = std::to_string(round);
        }
        EXPECT_EQ(task, ReadSection("TASK_" + Key("w", id))) << id;
        EXPECT_EQ((Pairs{{"ServerName", "srv"}}), ReadSection(Key("CLIENTID_w", id)));
    }
    EXPECT_THAT(common["shared"], testing::EndsWith(":" + std::to_string(kRounds - 2)));
    EXPECT_EQ((Pairs{{"s2sEnabled", "v" + std::to_string(kRounds - 1)},
                     {"clientID", kMarker},
                     {"serverName", kMarker}}),
              ReadSection("PairedClientInfo"));
    EXPECT_EQ((Pairs{{"ServerName", "oldsrv"}}), ReadSection("CLIENTID_old"));
    EXPECT_THAT(StoreDirectory(root), testing::ElementsAre("vurnS2S.info"));
}

// The pairing section is rewritten from what was read by the conversion and by pairing; a
// concurrent change of the service switch must survive both. The switch only counts up, so a
// lost update shows as a value going back.
TEST(PairingStoreStressTest, PairingAndConversionNeverTurnBackTheServiceSwitch) {
    StoreRoot root(/*inMemory=*/true);
    constexpr int kFlips = 1000;
    ASSERT_EQ(0, Update("PairedClientInfo",
                        {{"s2sEnabled", "0"}, {"clientID", "old"}, {"serverName", "oldsrv"}}));
    Shared<std::atomic<int>> done;
    std::atomic<int>* flipsDone = done.get();

    pid_t flipper = Spawn([] {
        for (int n = 1; n <= kFlips; ++n) {
            if (Update("PairedClientInfo", {{"s2sEnabled", std::to_string(n)}}) != 0) {
                return 1;
            }
        }
        return 0;
    });
    std::vector<pid_t> others;
    others.push_back(Spawn([flipsDone] {
        while (flipsDone->load() == 0) {
            if (s2s_svr_reset_pair() != 0) {
                return 1;
            }
        }
        return 0;
    }));
    others.push_back(Spawn([flipsDone] {
        for (int n = 0; flipsDone->load() == 0; ++n) {
            Table pair({{"clientID", Key("c", n % 3)}, {"serverName", "srv"}});
            if (S2SServerUpdatePairInfo(Key("c", n % 3).c_str(), "srv") != 0 ||
                S2SServerSetPairValue(pair.get()) != 0) {
                return 1;
            }
        }
        return 0;
    }));
    others.push_back(Spawn([flipsDone] {
        long seen = 0;
        while (flipsDone->load() == 0) {
            Pairs pairs = ReadSection("PairedClientInfo");
            const long now = std::stol(pairs["s2sEnabled"]);
            if (now < seen) {
                return 1;
            }
            seen = now;
        }
        return 0;
    }));
    EXPECT_EQ(0, WaitChild(flipper, std::chrono::minutes(5)));
    flipsDone->store(1);
    for (pid_t pid : others) {
        EXPECT_EQ(0, WaitChild(pid, std::chrono::minutes(1)));
    }
    EXPECT_EQ(std::to_string(kFlips), ReadSection("PairedClientInfo")["s2sEnabled"]);
    std::vector<std::string> names = SectionNames();
    EXPECT_EQ(names.size(), std::set<std::string>(names.begin(), names.end()).size());
}

// --- killed writers -----------------------------------------------------------------------------

struct Progress {
    std::atomic<long> started{0};    // the value of the last update begun
    std::atomic<long> completed{0};  // the value of the last update finished
    std::atomic<int> begun{0};       // updates begun by the current writer
};

std::string Padding(long n) {
    return std::string(3000, static_cast<char>('a' + n % 26));
}

// Rewrites the victim's section forever: "a" and "b" both n, the padding derived from n.
[[noreturn]] void Victim(Progress* progress) {
    for (;;) {
        const long n = progress->completed.load() + 1;
        const std::string value = std::to_string(n);
        progress->started.store(n);
        progress->begun.fetch_add(1);
        if (Update("TASK_victim", {{"a", value}, {"pad", Padding(n)}, {"b", value}}) != 0) {
            _exit(1);
        }
        progress->completed.store(n);
    }
}

TEST(PairingStoreStressTest, AWriterKilledAnywhereLeavesTheOldOrTheNewFile) {
    StoreRoot root;
    // Some bulk, so that a write takes long enough to be hit in the middle.
    for (int i = 0; i < 40; ++i) {
        ASSERT_EQ(0, Update(Key("SHARE_bulk", i), {{"CompleteID", std::string(200, 'c')},
                                                   {"RunningID", std::string(200, 'r')}}));
    }
    const Pairs sentinel = {{"CompleteID", "S"}, {"RunningID", "S"}};
    ASSERT_EQ(0, Update("SHARE_sentinel", {{"CompleteID", "S"}, {"RunningID", "S"}}));
    ASSERT_EQ(0, Update("TASK_victim", {{"a", "0"}, {"pad", Padding(0)}, {"b", "0"}}));
    ASSERT_EQ(0, Update("TASK_next", {{"n", "none"}}));
    const std::vector<std::string> namesBefore = SectionNames();

    Shared<Progress> progress;
    const unsigned seed = std::random_device{}();
    std::mt19937 random(seed);
    std::uniform_int_distribution<int> delayUs(0, 8000);
    int midUpdate = 0;
    int newVersion = 0;  // kills after the new file was in place, before the writer knew
    constexpr int kKills = 300;
    for (int kill_no = 0; kill_no < kKills; ++kill_no) {
        SCOPED_TRACE("seed " + std::to_string(seed) + ", kill " + std::to_string(kill_no));
        progress->begun.store(0);
        pid_t victim = Spawn([&] {
            Victim(progress.get());
            return 0;
        });
        ASSERT_GT(victim, 0);
        // The random point of the kill.
        std::this_thread::sleep_for(std::chrono::microseconds(delayUs(random)));
        ASSERT_EQ(0, kill(victim, SIGKILL));
        ASSERT_EQ(-1, WaitChild(victim)) << "the victim stopped on its own";

        const long started = progress->started.load();
        const long completed = progress->completed.load();
        if (progress->begun.load() > 0 && started > completed) {
            ++midUpdate;
        }
        int found = 0;
        Pairs victimPairs = ReadSection("TASK_victim", &found);
        ASSERT_GT(found, 0);
        const long a = std::stol(victimPairs["a"]);
        ASSERT_EQ(victimPairs["a"], victimPairs["b"]);
        ASSERT_EQ(Padding(a), victimPairs["pad"]);
        newVersion += a == completed + 1 ? 1 : 0;
        ASSERT_TRUE(a == completed || (a == completed + 1 && started == a))
            << "file " << a << ", started " << started << ", completed " << completed;
        ASSERT_EQ(sentinel, ReadSection("SHARE_sentinel"));
        ASSERT_EQ(namesBefore, SectionNames());

        // The next writer gets the semaphore (and the file) without waiting for the dead one.
        pid_t next = Spawn([kill_no] {
            return Update("TASK_next", {{"n", std::to_string(kill_no)}});
        });
        ASSERT_EQ(0, WaitChild(next, std::chrono::seconds(20)));
    }
    // Most kills should hit a writer at work; a run where none did proves little.
    RecordProperty("kills_during_update", midUpdate);
    RecordProperty("kills_after_replace", newVersion);
    EXPECT_GE(midUpdate, kKills / 10) << "kills during an update: " << midUpdate;
    EXPECT_EQ((Pairs{{"n", std::to_string(kKills - 1)}}), ReadSection("TASK_next"));
    // A temporary file left by a killed writer is gone once the next write went through.
    EXPECT_THAT(StoreDirectory(root), testing::ElementsAre("vurnS2S.info"));
}

TEST(PairingStoreStressTest, ASemaphoreHolderThatDiesReleasesIt) {
    StoreRoot root;
    int ready[2];
    ASSERT_EQ(0, pipe(ready));
    pid_t holder = Spawn([&] {
        VLIBSem* sem = VLIBCSemOpen(S2S::PairingStore::kSemaphoreKey);
        if (sem == nullptr || VLIBCSemLock(sem) != 0) {
            return 1;
        }
        char byte = 'x';
        if (write(ready[1], &byte, 1) != 1) {
            return 2;
        }
        for (;;) {
            pause();
        }
    });
    close(ready[1]);
    char byte = 0;
    ASSERT_EQ(1, read(ready[0], &byte, 1));
    close(ready[0]);

    // While it holds the semaphore, a writer waits...
    pid_t writer = Spawn([] { return Update("TASK_t", {{"status", "idle"}}); });
    EXPECT_EQ(-2, WaitChild(writer, std::chrono::milliseconds(300)));
    // ...and once it is killed, the next one goes through.
    ASSERT_EQ(0, kill(holder, SIGKILL));
    EXPECT_EQ(-1, WaitChild(holder));
    writer = Spawn([] { return Update("TASK_t", {{"status", "idle"}}); });
    EXPECT_EQ(0, WaitChild(writer, std::chrono::seconds(20)));
    EXPECT_EQ((Pairs{{"status", "idle"}}), ReadSection("TASK_t"));
}

// --- readers beside writers ---------------------------------------------------------------------

struct ReaderState {
    std::atomic<int> writersDone{0};
    std::atomic<long> reads{0};
};

bool Uniform(const std::string& value, size_t length) {
    return value.size() == length &&
           value.find_first_not_of(value.empty() ? 'x' : value[0]) == std::string::npos;
}

TEST(PairingStoreStressTest, ReadersNeverSeeATornKey) {
    StoreRoot root(/*inMemory=*/true);
    constexpr size_t kLength = 4096;
    constexpr int kReaderWriters = 4;
    constexpr int kReaders = 4;
    ASSERT_EQ(0, Update("PairedClientInfo", {{"clientID", "A"}, {"serverName", "srv"}}));
    ASSERT_EQ(0, Update("SHARE_torn", {{"v", std::string(kLength, 'a')}}));
    Shared<ReaderState> state;

    std::vector<pid_t> writers;
    for (int id = 0; id < kReaderWriters; ++id) {
        writers.push_back(Spawn([id] {
            for (int round = 0; round < 120; ++round) {
                const char letter = static_cast<char>('a' + (id * 7 + round) % 26);
                if (Update("SHARE_torn", {{"v", std::string(kLength, letter)}}) != 0 ||
                    Update(Key("TASK_r", id), {{"status", std::to_string(round)}}) != 0) {
                    return 1;
                }
            }
            return 0;
        }));
    }
    std::vector<pid_t> readers;
    ReaderState* shared = state.get();
    for (int id = 0; id < kReaders; ++id) {
        readers.push_back(Spawn([shared, id] {
            std::vector<char> buf(kLength * 2);
            while (shared->writersDone.load() == 0) {
                if (id % 2 == 0) {
                    int length = S2SServerGetShare("torn", "v", buf.data(), buf.size());
                    if (length != static_cast<int>(kLength) ||
                        !Uniform(std::string(buf.data()), kLength)) {
                        return 1;
                    }
                } else {
                    int found = 0;
                    Pairs pairs = ReadSection("SHARE_torn", &found);
                    s2s_svr_status status;
                    if (found <= 0 || !Uniform(pairs["v"], kLength) ||
                        s2s_svr_get_status(&status) != 0) {
                        return 2;
                    }
                    s2s_svr_put_status(&status);
                }
                shared->reads.fetch_add(1);
            }
            return 0;
        }));
    }
    for (pid_t writer : writers) {
        EXPECT_EQ(0, WaitChild(writer, std::chrono::minutes(5)));
    }
    state->writersDone.store(1);
    for (pid_t reader : readers) {
        EXPECT_EQ(0, WaitChild(reader, std::chrono::minutes(1)));
    }
    EXPECT_GT(state->reads.load(), 100);
}

}  // namespace
