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
#include <string>
#include <vector>

#include "host/pairing_store.h"
#include "platform/section_file.h"
#include "s2s_platform.h"

namespace S2S {
namespace PairingStore {
namespace {

constexpr const char* kLineFormat = "\t%s=\"%s\"\n";
constexpr const char* kPairSection = "PairedClientInfo";
constexpr const char* kMultiClientMarker = "S2SMULTI-SRC-SUPPORT";
constexpr int kPairTableSize = 1024;
constexpr int kUpdateTableSize = 512;
// Client IDs are read into buffers of this size; a longer stored ID cannot be read.
constexpr int kIdBufferSize = 36;
// A task counts as running while its last heartbeat is younger than this.
constexpr long kHeartbeatWindowSeconds = 120;

enum SharePairStatus { kShareRunning = 0, kShareCompleted = 1, kShareFree = 2 };

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

// One read of the store for a whole decision over many sections. Reading each share or task
// section on its own would read (or at least check) the whole file once per section; here every
// section is taken from the one version of the file read first, which is also the version a quick
// enough series of single reads would have seen. Lookups report what VLIBCFileGetSection would:
// the same results and platform errors, and a failed read is logged once, by the platform.
class StoreSnapshot {
  public:
    explicit StoreSnapshot(const char* file) : file_(file) {}

    // -1 (platform error set), or 0 with the file's document read.
    int Load() {
        if (!loaded_) {
            loaded_ = true;
            if (file_ == nullptr || *file_ == '\0') {
                error_ = VLIB_ERR_BAD_PARAMETER;
            } else {
                try {
                    error_ = s2s_platform::LoadSectionFileShared(file_, doc_) == 0 ? VLIB_ERR_NONE
                                                                                   : VLIBCErrGet();
                } catch (const std::bad_alloc&) {
                    error_ = VLIB_ERR_OUT_OF_MEMORY;
                }
            }
        }
        VLIBCErrSet(error_);
        return error_ == VLIB_ERR_NONE ? 0 : -1;
    }

    // Like VLIBCFileGetSection on `section`, keeping only the `count` keys of `keys`: -1 on a
    // failed read, 0 when the section is absent, 1 when found, with values[i] set and present[i]
    // true where the section has keys[i].
    int GetSection(const char* section, int count, const char* const* keys, std::string* values,
                   bool* present) {
        for (int i = 0; i < count; ++i) {
            present[i] = false;
        }
        if (section == nullptr || *section == '\0') {
            VLIBCErrSet(VLIB_ERR_BAD_PARAMETER);
            return -1;
        }
        if (Load() != 0) {
            return -1;
        }
        try {
            if (!doc_->HasSection(section)) {
                VLIBCErrSet(VLIB_ERR_NOT_FOUND);
                return 0;
            }
            for (int i = 0; i < count; ++i) {
                present[i] = doc_->GetValue(section, keys[i], values[i]);
            }
        } catch (const std::bad_alloc&) {
            VLIBCErrSet(VLIB_ERR_OUT_OF_MEMORY);
            return -1;
        }
        VLIBCErrSet(VLIB_ERR_NONE);
        return 1;
    }

    const s2s_platform::SectionDoc& doc() const { return *doc_; }

  private:
    const char* file_;
    bool loaded_ = false;
    int error_ = VLIB_ERR_NONE;
    std::shared_ptr<const s2s_platform::SectionDoc> doc_;
};

// Why a share cannot be paired by some client: its status and the client bound to it.
struct ShareState {
    int status = kShareFree;
    char owner[kIdBufferSize] = "";
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
    PlatformString section(SectionName("SHARE_", share));
    if (section.get() == nullptr) {
        return S2S_SVR_ERR_ALLOC;
    }
    static const char* const kKeys[] = {"CompleteID", "RunningID"};
    std::string ids[2];
    bool present[2];
    const int found = store->GetSection(section.get(), 2, kKeys, ids, present);
    const char* complete = found > 0 && present[0] ? ids[0].c_str() : nullptr;
    const char* running = found > 0 && present[1] ? ids[1].c_str() : nullptr;
    // IDs live in buffers of kIdBufferSize bytes; a longer one cannot be read.
    if (found < 0 || (complete != nullptr && strlen(complete) >= sizeof(ShareState::owner))) {
        Message("Failed to get section [%s] CompleteID value.", section.get());
        Message("getSharePairStatus error");
        return S2S_SVR_ERR_READ;
    }
    if (complete == nullptr) {  // no section or no completed ID: nobody holds the share
        state->status = kShareFree;
        state->owner[0] = '\0';
        return 0;
    }
    if (running == nullptr || strlen(running) >= sizeof(ShareState::owner)) {
        Message("Failed to get section [%s] RunningID value.", section.get());
        Message("getSharePairStatus error");
        return S2S_SVR_ERR_READ;
    }
    snprintf(state->owner, sizeof(state->owner), "%s", running);
    if (*complete == '\0') {
        state->status = *running != '\0' ? kShareRunning : kShareFree;
    } else if (*running == '\0') {
        state->status = kShareFree;
    } else {
        state->status = strcmp(running, complete) != 0 ? kShareRunning : kShareCompleted;
    }
    return 0;
}

bool CanClientPairTheShare(const ShareState& state, const char* clientId) {
    if (clientId == nullptr || *clientId == '\0') {
        Message("Parameter error on canClientPairTheShare.");
        return false;
    }
    switch (state.status) {
        case kShareRunning:
        case kShareCompleted:
            return strcmp(state.owner, clientId) == 0;
        case kShareFree:
            return true;
        default:
            Message("ShareStatus does not match any cases on canClientPairTheShare.");
            return false;
    }
}

// Whether some task sent a heartbeat within the window. Any failure reads as not busy. The
// section names and every task section come from one read of the file.
int AnyTaskBusy(const char* file) {
    StoreSnapshot store(file);
    std::vector<std::string> names;
    try {
        if (store.Load() != 0) {
            return 0;
        }
        names = store.doc().SectionNames();
    } catch (const std::bad_alloc&) {
        return 0;
    }
    const time_t now = time(nullptr);
    static const char* const kKeys[] = {"status"};
    for (const std::string& name : names) {
        if (name.compare(0, 5, "TASK_") != 0) {
            continue;
        }
        std::string value;
        bool present = false;
        const int found = store.GetSection(name.c_str(), 1, kKeys, &value, &present);
        if (found < 0) {
            return 0;
        }
        const char* status = present ? value.c_str() : nullptr;
        if (found == 0 || status == nullptr || strcmp(status, "idle") == 0) {
            continue;
        }
        // A future timestamp counts as busy: the clocks of the two servers need not agree.
        if (now - strtol(status, nullptr, 10) < kHeartbeatWindowSeconds) {
            return 1;
        }
    }
    return 0;
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
    PlatformString section(SectionName("SHARE_", share));
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
    PlatformString section(SectionName("TASK_", task));
    return section.get() != nullptr ? S2SUpdateServerInfo(section.get(), values) : -1;
}

int S2SServerUpdateShare(const char* share, VLIBSzHash* values) {
    if (share == nullptr) {
        return -1;
    }
    PlatformString section(SectionName("SHARE_", share));
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
    const char* clientId = VLIBCSzHashGetValue(values, "clientID");
    const char* serverName = VLIBCSzHashGetValue(values, "serverName");
    if (clientId == nullptr || serverName == nullptr) {
        return S2S_SVR_ERR_KEY;
    }
    // Only the two keys are written: the update keeps the section's other keys ("s2sEnabled")
    // as they are at the moment of the write, not as they were read a moment earlier.
    VLIBCHashRemoveAll(pair.get());
    if (!pair.Set("clientID", clientId) || !pair.Set("serverName", serverName)) {
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
    if (!client.Set("ServerName", server_name)) {
        return S2S_SVR_ERR_KEY;
    }
    PlatformString section(SectionName("CLIENTID_", client_id));
    if (section.get() == nullptr) {
        return S2S_SVR_ERR_ALLOC;
    }
    if (S2SUpdateServerInfo(section.get(), client.get()) < 0) {
        return S2S_SVR_ERR_WRITE;
    }
    if (!pair.Set("clientID", kMultiClientMarker) || !pair.Set("serverName", kMultiClientMarker)) {
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
    const char* clientId = pair.Get("clientID");
    const char* serverName = pair.Get("serverName");
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
    const char* clientId = pair.Get("clientID");
    const char* serverName = pair.Get("serverName");
    if (clientId == nullptr) {
        Message("Failed to get clientID from hash.");
    } else if (serverName == nullptr) {
        Message("Failed to get serverName from hash.");
    } else if (client.ok() && client.Set("ServerName", serverName)) {
        PlatformString section(SectionName("CLIENTID_", clientId));
        if (section.get() == nullptr ||
            VLIBCFileAddSection(file, section.get(), client.get(), nullptr) < 0) {
            Message("Failed to add section [%s].",
                    section.get() != nullptr ? section.get() : "CLIENTID_");
        }
    }

    if (!pair.Set("clientID", kMultiClientMarker) || !pair.Set("serverName", kMultiClientMarker)) {
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
    StoreSnapshot store(StorePath());
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
    const char* clientId = pair.Get("clientID");
    const char* serverName = pair.Get("serverName");
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
