// The receiving server's pairing store (see include/s2s_server.h and docs/pairing-store.md).
//
// The section file itself is the platform's business: every write replaces the whole file
// atomically, so readers and crashes see the old or the new file. What this file adds is the
// store's layout, its result codes, and the system-wide semaphore that turns each update into
// one read-modify-write no other writer can interleave with.
#include "s2s_server.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <new>
#include <optional>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "core/protocol.h"
#include "host/pairing_store.h"
#include "s2s_platform.h"

namespace S2S {
namespace PairingStore {
namespace {

constexpr const char* kLineFormat = "\t%s=\"%s\"\n";
constexpr const char* kPairSection = "PairedClientInfo";
constexpr int kPairTableSize = 1024;
constexpr int kUpdateTableSize = 512;
// Client IDs are read into buffers of this size; a longer stored ID cannot be read.
constexpr int kIdBufferSize = 36;
// A task counts as running while its last heartbeat is younger than this.
constexpr long kHeartbeatWindowSeconds = 120;

// The store's results are the exchange's own numbers: the receiver passes them on as answers.
static_assert(S2S_SVR_OK == protocol::kOK, "");
static_assert(S2S_SVR_ERR_ALLOC == protocol::kStoreAlloc, "");
static_assert(S2S_SVR_ERR_ARGUMENT == protocol::kMissingKey, "");
static_assert(S2S_SVR_ERR_KEY == protocol::kUnknownKey, "");
static_assert(S2S_SVR_ERR_WRITE == protocol::kStoreWrite, "");
static_assert(S2S_SVR_ERR_READ == protocol::kStoreRead, "");
static_assert(S2S_SVR_ERR_SHARE_PAIRED == protocol::kShareConflict, "");

// Sections and keys of the store.
constexpr const char* kClientPrefix = kClientSectionPrefix;
constexpr const char* kSharePrefix = "SHARE_";
constexpr const char* kTaskPrefix = kTaskSectionPrefix;
constexpr const char* kClientID = "clientID";
constexpr const char* kServerName = "serverName";
constexpr const char* kClientServerName = "ServerName";
constexpr const char* kCompleteID = "CompleteID";
constexpr const char* kRunningID = "RunningID";
constexpr const char* kLastStart = "LastStart";
constexpr const char* kLastResult = "LastResult";
constexpr const char* kLastTime = "LastTime";
constexpr const char* kTaskStatus = "status";
constexpr const char* kTaskIdle = "idle";

std::atomic<MessageSink> g_sink{nullptr};

void Message(const char* format, ...) __attribute__((format(printf, 1, 2)));
void Message(const char* format, ...) {
    va_list args;
    va_start(args, format);
    MessageSink sink = g_sink.load();
    if (sink == nullptr) {
        vsyslog(LOG_ERR, format, args);
    } else {
        char text[8192];
        vsnprintf(text, sizeof(text), format, args);
        sink(text);
    }
    va_end(args);
}

// Null only when memory for the path under $S2S_ROOT ran out; the platform's file functions
// then refuse the null path, and messages show it as "".
const char* StorePath() {
    return S2SPath(S2S_PATH_PAIRING_STORE);
}

// Owners of the platform's objects. The platform may replace a table when it grows it,
// so callers pass `slot()` and the owner frees whatever ends up there.
class Table {
  public:
    explicit Table(int size) : hash_(VLIBCSzHashAlloc(size)) {}
    ~Table() { VLIBCSzHashFree(hash_); }
    Table(const Table&) = delete;
    Table& operator=(const Table&) = delete;

    bool ok() const { return hash_ != nullptr; }
    VLIBSzHash* get() const { return hash_; }
    VLIBSzHash** slot() { return &hash_; }
    const char* Get(const char* key) const { return VLIBCSzHashGetValue(hash_, key); }
    bool Set(const char* key, const char* value) {
        return VLIBCSzHashSetValue(&hash_, key, value) >= 0;
    }

  private:
    VLIBSzHash* hash_;
};

class PlatformString {
  public:
    explicit PlatformString(char* str) : str_(str) {}
    ~PlatformString() { VLIBCStrPut(str_); }
    PlatformString(const PlatformString&) = delete;
    PlatformString& operator=(const PlatformString&) = delete;

    const char* get() const { return str_; }

  private:
    char* str_;
};

// Holds the store's semaphore from Acquire() until destruction.
class WriterLock {
  public:
    WriterLock() = default;
    ~WriterLock() {
        if (sem_ != nullptr) {
            if (locked_) {
                VLIBCSemUnlock(sem_);
            }
            VLIBCSemClose(sem_);
        }
    }
    WriterLock(const WriterLock&) = delete;
    WriterLock& operator=(const WriterLock&) = delete;

    bool Acquire() {
        sem_ = VLIBCSemOpen(kSemaphoreKey);
        if (sem_ == nullptr) {
            return false;
        }
        locked_ = VLIBCSemLock(sem_) == 0;
        return locked_;
    }

  private:
    VLIBSem* sem_ = nullptr;
    bool locked_ = false;
};

// The path as one shell word. The store's path normally needs no quoting, so the command reads
// "touch <path>"; anything unusual in $S2S_ROOT is single-quoted so the shell never reads it.
std::string ShellWord(const char* path) {
    bool plain = *path != '\0';
    for (const char* c = path; *c != '\0'; ++c) {
        if (strchr("/._-+,:@%", *c) == nullptr && !(*c >= 'a' && *c <= 'z') &&
            !(*c >= 'A' && *c <= 'Z') && !(*c >= '0' && *c <= '9')) {
            plain = false;
            break;
        }
    }
    if (plain) {
        return path;
    }
    std::string word = "'";
    for (const char* c = path; *c != '\0'; ++c) {
        if (*c == '\'') {
            word += "'\\''";
        } else {
            word += *c;
        }
    }
    return word + "'";
}

// Creates the store's file when it is not a regular file yet, with the "touch" command (which
// leaves an existing file's contents alone). `commandSize` bounds the command line; a path too
// long for it is not touched at all rather than cut. 0, or -1 when the command could not run.
int EnsureFile(size_t commandSize) {
    const char* path = StorePath();
    if (path == nullptr) {
        return -1;
    }
    if (isFileExist(path)) {
        return 0;
    }
    std::string command = "touch " + ShellWord(path);
    if (command.size() >= commandSize) {
        return -1;
    }
    return system(command.c_str()) == -1 ? -1 : 0;
}

int EnsureFile() {
    return EnsureFile(512);
}

// "SHARE_<share>" and the like; null when out of memory.
char* SectionName(const char* prefix, const char* name) {
    return VLIBCStrGet("%s%s", prefix, name);
}

typedef std::vector<std::pair<std::string, std::string>> Pairs;

// The value of `key` in `pairs`, unset when the section lacks it.
std::optional<std::string> ValueOf(const Pairs& pairs, const char* key) {
    for (const auto& pair : pairs) {
        if (pair.first == key) {
            return pair.second;
        }
    }
    return std::nullopt;
}

ShareFields ShareFieldsOf(const Pairs& pairs) {
    ShareFields fields;
    fields.completeID = ValueOf(pairs, kCompleteID);
    fields.runningID = ValueOf(pairs, kRunningID);
    fields.lastStart = ValueOf(pairs, kLastStart);
    fields.lastResult = ValueOf(pairs, kLastResult);
    fields.lastTime = ValueOf(pairs, kLastTime);
    return fields;
}

// An ID the store's readers cannot take: they read IDs into kIdBufferSize bytes.
bool TooLong(const std::optional<std::string>& id) {
    return id && id->size() >= static_cast<size_t>(kIdBufferSize);
}

// A share is running while its running ID is set and differs from a non-empty completed ID (or
// the completed ID is empty), completed when both are equal and non-empty, and free otherwise,
// also without a record or without a completed ID.
ShareBinding BindingOf(const ShareFields& fields) {
    if (!fields.completeID) {
        return ShareBinding::kFree;
    }
    if (TooLong(fields.completeID) || !fields.runningID || TooLong(fields.runningID)) {
        return ShareBinding::kUnreadable;
    }
    const std::string& complete = *fields.completeID;
    const std::string& running = *fields.runningID;
    if (complete.empty()) {
        return running.empty() ? ShareBinding::kFree : ShareBinding::kRunning;
    }
    if (running.empty()) {
        return ShareBinding::kFree;
    }
    return running != complete ? ShareBinding::kRunning : ShareBinding::kCompleted;
}

// One read of the store for a whole decision over many sections. Reading each share or task
// section on its own would read (or at least check) the whole file once per section; here every
// section is taken from the one version of the file read first, which is also the version a quick
// enough series of single reads would have seen. Lookups report what VLIBCFileGetSection would:
// the same results and platform errors, and a failed read is logged once, by the platform. Only
// the sections whose names start with `prefix` are kept.
class StoreSnapshot {
  public:
    StoreSnapshot(const char* file, const char* prefix) : file_(file), prefix_(prefix) {}

    // -1 (platform error set), or 0 with the file's sections read.
    int Load() {
        if (!loaded_) {
            loaded_ = true;
            if (file_ == nullptr || *file_ == '\0') {
                error_ = VLIB_ERR_BAD_PARAMETER;
            } else {
                const int rc = VLIBCFileVisitSections(file_, prefix_, &StoreSnapshot::Keep, this);
                error_ =
                    rc == 0 ? VLIB_ERR_NONE : (rc < 0 ? VLIBCErrGet() : VLIB_ERR_OUT_OF_MEMORY);
            }
        }
        VLIBCErrSet(error_);
        return error_ == VLIB_ERR_NONE ? 0 : -1;
    }

    // Like VLIBCFileGetSection on `section`: -1 on a failed read, 0 when the section is absent,
    // 1 when found, with `*pairs` pointing at its pairs.
    int GetSection(const char* section, const Pairs** pairs) {
        *pairs = nullptr;
        if (section == nullptr || *section == '\0') {
            VLIBCErrSet(VLIB_ERR_BAD_PARAMETER);
            return -1;
        }
        if (Load() != 0) {
            return -1;
        }
        auto it = sections_.find(section);
        if (it == sections_.end()) {
            VLIBCErrSet(VLIB_ERR_NOT_FOUND);
            return 0;
        }
        *pairs = &it->second;
        VLIBCErrSet(VLIB_ERR_NONE);
        return 1;
    }

    // The section names in file order, a name repeated by hand once per header.
    const std::vector<std::string>& names() const { return names_; }

  private:
    static int Keep(void* arg, const char* section, int count, const char* const* keys,
                    const char* const* values) {
        StoreSnapshot* self = static_cast<StoreSnapshot*>(arg);
        try {
            self->names_.push_back(section);
            auto added = self->sections_.emplace(section, Pairs());
            if (added.second) {
                for (int i = 0; i < count; ++i) {
                    added.first->second.emplace_back(keys[i], values[i]);
                }
            }
        } catch (const std::bad_alloc&) {
            return 1;
        }
        return 0;
    }

    const char* file_;
    const char* prefix_;
    bool loaded_ = false;
    int error_ = VLIB_ERR_NONE;
    std::vector<std::string> names_;
    std::unordered_map<std::string, Pairs> sections_;
};

// Why a share cannot be paired by some client: its binding and the client bound to it.
struct ShareState {
    ShareBinding binding = ShareBinding::kFree;
    std::string owner;
};

// Reads the share's binding from `store` into `state`. 0; 206 when its section cannot be read;
// 200 out of memory. An empty name keeps the previous share's state.
//
// Both IDs come from one read of the section, so a share rewritten meanwhile is judged on one
// version of it, never on the completed ID of one and the running ID of the next.
int GetSharePairStatus(const char* share, StoreSnapshot* store, ShareState* state) {
    if (share == nullptr || *share == '\0') {
        Message("Parameter error on getSharePairStatus.");
        return 0;
    }
    PlatformString section(SectionName(kSharePrefix, share));
    if (section.get() == nullptr) {
        return S2S_SVR_ERR_ALLOC;
    }
    const Pairs* pairs = nullptr;
    const int found = store->GetSection(section.get(), &pairs);
    const ShareFields fields = pairs != nullptr ? ShareFieldsOf(*pairs) : ShareFields();
    if (found < 0 || TooLong(fields.completeID)) {
        Message("Failed to get section [%s] CompleteID value.", section.get());
        Message("getSharePairStatus error");
        return S2S_SVR_ERR_READ;
    }
    const ShareBinding binding = BindingOf(fields);
    if (binding == ShareBinding::kUnreadable) {
        Message("Failed to get section [%s] RunningID value.", section.get());
        Message("getSharePairStatus error");
        return S2S_SVR_ERR_READ;
    }
    state->binding = binding;
    state->owner = binding == ShareBinding::kFree ? std::string() : *fields.runningID;
    return 0;
}

bool CanClientPairTheShare(const ShareState& state, const char* clientId) {
    if (clientId == nullptr || *clientId == '\0') {
        Message("Parameter error on canClientPairTheShare.");
        return false;
    }
    switch (state.binding) {
        case ShareBinding::kRunning:
        case ShareBinding::kCompleted:
            return state.owner == clientId;
        case ShareBinding::kFree:
            return true;
        default:
            Message("ShareStatus does not match any cases on canClientPairTheShare.");
            return false;
    }
}

// Whether some task sent a heartbeat within the window. Any failure reads as not busy. The
// section names and every task section come from one read of the file; the walk stops at the
// first busy task.
int AnyTaskBusy(const char* file) {
    if (file == nullptr || *file == '\0') {
        return 0;
    }
    struct Scan {
        time_t now;
        static int Visit(void* arg, const char*, int count, const char* const* keys,
                         const char* const* values) {
            const Scan* scan = static_cast<const Scan*>(arg);
            for (int i = 0; i < count; ++i) {
                if (strcmp(keys[i], kTaskStatus) != 0) {
                    continue;
                }
                // A future timestamp counts as busy: the clocks of the two servers need not
                // agree.
                return strcmp(values[i], kTaskIdle) != 0 &&
                       scan->now - strtol(values[i], nullptr, 10) < kHeartbeatWindowSeconds;
            }
            return 0;
        }
    } scan{time(nullptr)};
    return VLIBCFileVisitSections(file, kTaskPrefix, &Scan::Visit, &scan) == 1 ? 1 : 0;
}

// The update itself; the caller holds the semaphore. Sets the keys of `values` in `section`,
// appending the section when it is absent.
bool UpdateSection(const char* file, const char* section, VLIBSzHash* values) {
    Table current(kUpdateTableSize);
    if (!current.ok()) {
        return false;
    }
    if (*section != '\0') {
        const int found = VLIBCFileGetSection(file, section, current.slot());
        // A file that vanished since it was ensured holds no section: it is created below.
        if (found < 0 && VLIBCErrGet() != VLIB_ERR_FILE_NOT_FOUND) {
            Message("VLIBCFileGetSection error. filePath:[%s] szOldSecName:[%s]  iRet:[%d]", file,
                    section, found);
            return false;
        }
        if (found > 0) {
            if (VLIBCFileSetSection(file, section, nullptr, values, kLineFormat) < 0) {
                Message("VLIBCFileSetSection() failed!! szFile=[%s], section=[%s], errno=[0x%04X]",
                        file, section, VLIBCErrGet());
                return false;
            }
            return true;
        }
    }
    struct stat st;
    if (stat(file, &st) != 0) {
        // The texts match syslog's "errno=[%d/%m]"; %m itself is not portable printf.
        char reason[128];
        int err = errno;
        if (err != ENOENT) {
            Message("Failed to stat file [%s], errno=[%d/%s]", file, err,
                    strerror_r(err, reason, sizeof(reason)));
            return false;
        }
        int fd = open(file, O_RDWR | O_CREAT | O_EXCL | O_TRUNC | O_SYNC | O_CLOEXEC, 0777);
        if (fd < 0) {
            err = errno;
            Message("Failed to open file [%s], errno=[%d/%s]", file, err,
                    strerror_r(err, reason, sizeof(reason)));
            return false;
        }
        close(fd);
    }
    if (VLIBCFileAddSection(file, section, values, kLineFormat) <= 0) {
        Message("VLIBCFileAddSection() failed!! szFile=[%s], section=[%s], errno=[0x%04X]", file,
                section, VLIBCErrGet());
        return false;
    }
    return true;
}

}  // namespace

MessageSink SetMessageSink(MessageSink sink) {
    return g_sink.exchange(sink);
}

bool ShareFields::Holds(const ShareFields& wanted) const {
    auto same = [](const std::optional<std::string>& have, const std::optional<std::string>& want) {
        return !want || have == want;
    };
    return same(completeID, wanted.completeID) && same(runningID, wanted.runningID) &&
           same(lastStart, wanted.lastStart) && same(lastResult, wanted.lastResult) &&
           same(lastTime, wanted.lastTime);
}

const StoreClient* StoreContents::FindClient(const std::string& clientID) const {
    for (const StoreClient& client : clients) {
        if (client.clientID == clientID) {
            return &client;
        }
    }
    return nullptr;
}

const StoreShare* StoreContents::FindShare(const std::string& name) const {
    for (const StoreShare& share : shares) {
        if (share.name == name) {
            return &share;
        }
    }
    return nullptr;
}

const StoreTask* StoreContents::FindTask(const std::string& key) const {
    for (const StoreTask& task : tasks) {
        if (task.key == key) {
            return &task;
        }
    }
    return nullptr;
}

int StoreContents::CountTasks(const std::string& prefix) const {
    int count = 0;
    for (const StoreTask& task : tasks) {
        count += task.key.compare(0, prefix.size(), prefix) == 0;
    }
    return count;
}

int ReadStore(StoreContents* contents) {
    *contents = StoreContents();
    EnsureFile();
    StoreSnapshot store(StorePath(), "");
    if (store.Load() != 0) {
        return -1;
    }
    auto starts = [](const std::string& name, const char* prefix) {
        return name.compare(0, strlen(prefix), prefix) == 0;
    };
    try {
        for (const std::string& name : store.names()) {
            const Pairs* pairs = nullptr;
            if (store.GetSection(name.c_str(), &pairs) <= 0) {
                continue;
            }
            if (name == kPairSection) {
                contents->pairedClientID = ValueOf(*pairs, kClientID).value_or("");
                contents->pairedServerName = ValueOf(*pairs, kServerName).value_or("");
            } else if (starts(name, kClientPrefix)) {
                contents->clients.push_back({name.substr(strlen(kClientPrefix)),
                                             ValueOf(*pairs, kClientServerName).value_or("")});
            } else if (starts(name, kSharePrefix)) {
                StoreShare share;
                share.name = name.substr(strlen(kSharePrefix));
                share.fields = ShareFieldsOf(*pairs);
                share.binding = BindingOf(share.fields);
                if (share.binding == ShareBinding::kRunning ||
                    share.binding == ShareBinding::kCompleted) {
                    share.owner = *share.fields.runningID;
                }
                contents->shares.push_back(std::move(share));
            } else if (starts(name, kTaskPrefix)) {
                contents->tasks.push_back(
                    {name.substr(strlen(kTaskPrefix)), ValueOf(*pairs, kTaskStatus).value_or("")});
            }
        }
    } catch (const std::bad_alloc&) {
        VLIBCErrSet(VLIB_ERR_OUT_OF_MEMORY);
        return -1;
    }
    VLIBCErrSet(VLIB_ERR_NONE);
    return 0;
}

int UpdateShareRecord(const std::string& share, const ShareFields& fields) {
    SectionUpdate update{kSharePrefix + share, {}};
    const std::pair<const char*, const std::optional<std::string>*> keys[] = {
        {kRunningID, &fields.runningID},
        {kCompleteID, &fields.completeID},
        {kLastStart, &fields.lastStart},
        {kLastResult, &fields.lastResult},
        {kLastTime, &fields.lastTime}};
    for (const auto& key : keys) {
        if (*key.second) {
            update.values.emplace_back(key.first, **key.second);
        }
    }
    return ApplyUpdates({update});
}

int RecordTaskStatus(const std::string& key, const std::string& status) {
    return ApplyUpdates({{kTaskPrefix + key, {{kTaskStatus, status}}}});
}

int RecordClient(const std::string& clientID, const std::string& serverName) {
    return ApplyUpdates(
        {{kClientPrefix + clientID, {{kClientServerName, serverName}}},
         {kPairSection, {{kClientID, kMultiClientMarker}, {kServerName, kMultiClientMarker}}}});
}

}  // namespace PairingStore
}  // namespace S2S

using namespace S2S::PairingStore;  // NOLINT: the C entry points below are its only users

extern "C" {

int isFileExist(const char* path) {
    struct stat st;
    if (path == nullptr || stat(path, &st) != 0) {
        return 0;
    }
    return S_ISREG(st.st_mode) ? 1 : 0;
}

int S2SCheckServerInfo(void) {
    EnsureFile(256);
    return 0;
}

int S2SGetServerInfo(const char* section, VLIBSzHash** out) {
    if (section == nullptr || out == nullptr || *out == nullptr) {
        VLIBCErrSet(VLIB_ERR_BAD_PARAMETER);
        return -1;
    }
    EnsureFile();
    return VLIBCFileGetSection(StorePath(), section, out);
}

int S2SServerGetShare(const char* share, const char* key, char* buf, int size) {
    if (share == nullptr || key == nullptr || buf == nullptr || size <= 0) {
        VLIBCErrSet(VLIB_ERR_BAD_PARAMETER);
        return -1;
    }
    EnsureFile();
    PlatformString section(SectionName(kSharePrefix, share));
    if (section.get() == nullptr) {
        VLIBCErrSet(VLIB_ERR_OUT_OF_MEMORY);
        return -1;
    }
    return VLIBCFileGetSectionValue(StorePath(), section.get(), key, buf, size);
}

int S2SUpdateServerInfo(const char* section, VLIBSzHash* values) {
    const char* file = StorePath();
    bool ok = false;
    int error = VLIB_ERR_BAD_PARAMETER;
    if (section != nullptr && values != nullptr && file != nullptr) {
        EnsureFile();
        WriterLock lock;
        if (!lock.Acquire()) {
            Message("S2SUpdateServerInfo() lock failed");
            return -1;
        }
        ok = UpdateSection(file, section, values);
        error = VLIBCErrGet();
    }
    if (!ok) {
        Message("Set section [%s ] value into [%s] error.", section != nullptr ? section : "",
                file != nullptr ? file : "");
        // The reason stays readable after the lock's release (VLIB_ERR_TOO_LARGE: the store
        // would grow past what its reader takes, and nothing was written).
        VLIBCErrSet(error);
        return -1;
    }
    return 0;
}

int S2SServerUpdateTask(const char* task, VLIBSzHash* values) {
    if (task == nullptr) {
        return -1;
    }
    PlatformString section(SectionName(kTaskPrefix, task));
    return section.get() != nullptr ? S2SUpdateServerInfo(section.get(), values) : -1;
}

int S2SServerUpdateShare(const char* share, VLIBSzHash* values) {
    if (share == nullptr) {
        return -1;
    }
    PlatformString section(SectionName(kSharePrefix, share));
    return section.get() != nullptr ? S2SUpdateServerInfo(section.get(), values) : -1;
}

int S2SServerSetPairValue(VLIBSzHash* values) {
    if (values == nullptr) {
        return S2S_SVR_ERR_ARGUMENT;
    }
    Table pair(kPairTableSize);
    if (!pair.ok()) {
        return S2S_SVR_ERR_ALLOC;
    }
    if (S2SGetServerInfo(kPairSection, pair.slot()) < 0) {
        return S2S_SVR_ERR_READ;
    }
    const char* clientId = VLIBCSzHashGetValue(values, kClientID);
    const char* serverName = VLIBCSzHashGetValue(values, kServerName);
    if (clientId == nullptr || serverName == nullptr) {
        return S2S_SVR_ERR_KEY;
    }
    // Only the two keys are written: the update keeps the section's other keys ("s2sEnabled")
    // as they are at the moment of the write, not as they were read a moment earlier.
    VLIBCHashRemoveAll(pair.get());
    if (!pair.Set(kClientID, clientId) || !pair.Set(kServerName, serverName)) {
        return S2S_SVR_ERR_KEY;
    }
    return S2SUpdateServerInfo(kPairSection, pair.get()) < 0 ? S2S_SVR_ERR_WRITE : S2S_SVR_OK;
}

int S2SServerUpdatePairInfo(const char* client_id, const char* server_name) {
    if (client_id == nullptr || *client_id == '\0' || server_name == nullptr ||
        *server_name == '\0') {
        return S2S_SVR_ERR_ARGUMENT;
    }
    Table client(kPairTableSize);
    Table pair(kPairTableSize);
    if (!client.ok() || !pair.ok()) {
        return S2S_SVR_ERR_ALLOC;
    }
    if (!client.Set(kClientServerName, server_name)) {
        return S2S_SVR_ERR_KEY;
    }
    PlatformString section(SectionName(kClientPrefix, client_id));
    if (section.get() == nullptr) {
        return S2S_SVR_ERR_ALLOC;
    }
    if (S2SUpdateServerInfo(section.get(), client.get()) < 0) {
        return S2S_SVR_ERR_WRITE;
    }
    if (!pair.Set(kClientID, kMultiClientMarker) || !pair.Set(kServerName, kMultiClientMarker)) {
        return S2S_SVR_ERR_KEY;
    }
    return S2SServerSetPairValue(pair.get()) != 0 ? S2S_SVR_ERR_WRITE : S2S_SVR_OK;
}

int S2SServerIfOldClientPaired(void) {
    Table pair(kPairTableSize);
    if (!pair.ok()) {
        Message("Failed to allocate memory of hash.");
        return -1;
    }
    if (S2SGetServerInfo(kPairSection, pair.slot()) < 0) {
        Message("Get server paired-info error.");
        return -1;
    }
    const char* clientId = pair.Get(kClientID);
    const char* serverName = pair.Get(kServerName);
    if (clientId == nullptr || *clientId == '\0' || serverName == nullptr || *serverName == '\0') {
        return 0;
    }
    if (strcmp(clientId, kMultiClientMarker) == 0) {
        return strcmp(serverName, kMultiClientMarker) != 0 ? 1 : 0;
    }
    return 1;
}

int s2s_svr_reset_pair(void) {
    const char* file = StorePath();
    if (file == nullptr) {
        return -1;
    }
    // One lock over the whole conversion, so that no other writer's change to the pairing
    // section falls between reading it and writing it back.
    WriterLock lock;
    if (!lock.Acquire()) {
        Message("s2s_svr_reset_pair() lock failed");
        return -1;
    }
    Table pair(kPairTableSize);
    if (!pair.ok() || S2SGetServerInfo(kPairSection, pair.slot()) < 0) {
        return -1;
    }

    // Moving the old client to its own section is best effort: the conversion goes on without.
    EnsureFile();
    Table client(kPairTableSize);
    const char* clientId = pair.Get(kClientID);
    const char* serverName = pair.Get(kServerName);
    if (clientId == nullptr) {
        Message("Failed to get clientID from hash.");
    } else if (serverName == nullptr) {
        Message("Failed to get serverName from hash.");
    } else if (client.ok() && client.Set(kClientServerName, serverName)) {
        PlatformString section(SectionName(kClientPrefix, clientId));
        if (section.get() == nullptr ||
            VLIBCFileAddSection(file, section.get(), client.get(), nullptr) < 0) {
            Message("Failed to add section [%s].",
                    section.get() != nullptr ? section.get() : kClientPrefix);
        }
    }

    if (!pair.Set(kClientID, kMultiClientMarker) || !pair.Set(kServerName, kMultiClientMarker)) {
        return -1;
    }
    if (EnsureFile() != 0) {
        return -1;
    }
    int result = VLIBCIFileModifySection(file, kPairSection, nullptr, pair.get(), 1, nullptr);
    if (result == 0) {
        result = VLIBCFileAddSection(file, kPairSection, pair.get(), nullptr);
    }
    return result < 0 ? -1 : 0;
}

int S2SCheckIfSharePaired(VLIBSzList* shares, const char* client_id, VLIBSzList** refused) {
    if (shares == nullptr || VLIBCSzListCount(shares) == 0 || client_id == nullptr ||
        *client_id == '\0' || refused == nullptr) {
        Message("Input parameters are null or empty!");
        return S2S_SVR_ERR_ARGUMENT;
    }
    if (*refused == nullptr) {
        *refused = VLIBCSzListAlloc(VLIBCSzListCount(shares));
        if (*refused == nullptr) {
            return S2S_SVR_ERR_ALLOC;
        }
    }
    VLIBCSzListRemoveAll(*refused);
    EnsureFile();
    // The file is read when the first share is looked up, after it was ensured.
    StoreSnapshot store(StorePath(), kSharePrefix);
    ShareState state;
    const int count = VLIBCSzListCount(shares);
    for (int i = 0; i < count; ++i) {
        const char* share = VLIBCSzListGet(shares, i);
        const int read = GetSharePairStatus(share, &store, &state);
        if (read != 0) {
            return read;
        }
        if (!CanClientPairTheShare(state, client_id) &&
            VLIBCSzListPush(refused, share != nullptr ? share : "") < 0) {
            return S2S_SVR_ERR_ALLOC;
        }
    }
    return VLIBCSzListCount(*refused) > 0 ? S2S_SVR_ERR_SHARE_PAIRED : S2S_SVR_OK;
}

int s2s_svr_get_status(s2s_svr_status* status) {
    if (status == nullptr) {
        return -1;
    }
    status->running = 0;
    status->busy = 0;
    status->client_id = nullptr;
    status->server_name = nullptr;

    EnsureFile();
    Table pair(kPairTableSize);
    if (!pair.ok() || S2SGetServerInfo(kPairSection, pair.slot()) <= 0) {
        return -1;
    }
    const char* enabled = pair.Get("s2sEnabled");
    if (enabled != nullptr && strcmp(enabled, "yes") == 0 &&
        VLIBCProcAliveByPidFile(S2SPath(S2S_PATH_RSYNCD_PID)) != 0) {
        status->running = 1;
    }
    const char* clientId = pair.Get(kClientID);
    const char* serverName = pair.Get(kServerName);
    status->client_id = clientId != nullptr ? VLIBCStrGet("%s", clientId) : nullptr;
    status->server_name = serverName != nullptr ? VLIBCStrGet("%s", serverName) : nullptr;
    status->busy = AnyTaskBusy(StorePath());
    return 0;
}

int s2s_svr_put_status(s2s_svr_status* status) {
    if (status == nullptr) {
        return 0;
    }
    VLIBCStrPut(status->client_id);
    VLIBCStrPut(status->server_name);
    status->client_id = nullptr;
    status->server_name = nullptr;
    return 0;
}

}  // extern "C"
