// The pairing store's typed face for the receiver (clients, shares with their states, task
// heartbeats, read in one go), and the internals its tests reach: where its messages go. The
// store's sections and keys are known to host/pairing_store.cpp alone (docs/pairing-store.md).
#ifndef S2S_HOST_PAIRING_STORE_H
#define S2S_HOST_PAIRING_STORE_H

#include <sys/types.h>

#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace S2S {
namespace PairingStore {

// The semaphore every writer of the store takes: one per system, shared with every other
// program that writes the file.
constexpr int kSemaphoreKey = 0x2980298;

// Stands in the pairing section's client ID and server name once the store is multi-client;
// never a client itself.
constexpr const char* kMultiClientMarker = "S2SMULTI-SRC-SUPPORT";

// The section prefixes of clients and of task heartbeats, for messages that name them.
constexpr const char* kClientSectionPrefix = "CLIENTID_";
constexpr const char* kTaskSectionPrefix = "TASK_";

// Receives each message, already formatted, instead of syslog. Called from any thread; must not
// call back into the store.
using MessageSink = void (*)(const char* message);

// Sends the store's messages to `sink`, or back to syslog (LOG_ERR) when null. Returns the sink
// that was in place.
MessageSink SetMessageSink(MessageSink sink);

// A share's record as stored; a key the record lacks stays unset.
struct ShareFields {
    std::optional<std::string> completeID;  // the client that last completed a sync into it
    std::optional<std::string> runningID;   // the client bound to it
    std::optional<std::string> lastStart;   // when a client last started a sync (epoch seconds)
    std::optional<std::string> lastResult;  // how the last finished sync ended
    std::optional<std::string> lastTime;    // and when

    // True when every field `wanted` sets is set here to the same value.
    bool Holds(const ShareFields& wanted) const;
};

// The store's one reading of a share's two IDs (S2SCheckIfSharePaired decides on it too).
enum class ShareBinding {
    kRunning,    // bound to `owner` while it syncs
    kCompleted,  // `owner` completed a sync and is still bound to it
    kFree,       // any client may take it (also without a record or a completed ID)
    kUnreadable  // a completed ID without a running ID, or an ID too long to read: not judged
};

struct StoreShare {
    std::string name;
    ShareFields fields;
    ShareBinding binding = ShareBinding::kFree;
    std::string owner;  // the bound client; "" unless running or completed
};

struct StoreClient {
    std::string clientID;
    std::string serverName;
};

struct StoreTask {
    std::string key;     // "<client ID>/<task name>" as the receiver records it
    std::string status;  // "idle", or the last heartbeat (epoch seconds)
};

// The whole store from one read of the file. Lists keep the file's order.
struct StoreContents {
    // The pairing section's single client, or kMultiClientMarker; "" when absent.
    std::string pairedClientID;
    std::string pairedServerName;
    std::vector<StoreClient> clients;
    std::vector<StoreShare> shares;
    std::vector<StoreTask> tasks;

    const StoreClient* FindClient(const std::string& clientID) const;
    const StoreShare* FindShare(const std::string& name) const;
    const StoreTask* FindTask(const std::string& key) const;
    // How many task keys start with `prefix`.
    int CountTasks(const std::string& prefix) const;
};

// Reads the store, creating its file empty first when missing (as every read of the store does).
// 0, or -1 with the platform error set (VLIB_ERR_FILE_NOT_FOUND when the file could not be
// created).
int ReadStore(StoreContents* contents);

// The keys to set in one section of the store (the section is appended when it is missing).
struct SectionUpdate {
    std::string section;
    std::vector<std::pair<std::string, std::string>> values;
};

// The receiver's writer (host/pairing_store_batch.cpp). Writes `updates` in one replacement of
// the store, together with the updates other processes have waiting at that moment, under the
// same semaphore as every other writer: many writers at once share one replacement (and its two
// fsyncs) instead of taking turns for one each. The updates of one call are all-or-nothing and
// durable when it returns 0; a write that would change nothing is skipped. Unlike
// S2SUpdateServerInfo it may set several sections at once and logs through the library's logger.
// 0, or -1 with the platform error set (VLIB_ERR_TOO_LARGE: nothing was written).
int ApplyUpdates(const std::vector<SectionUpdate>& updates);
// The name of the queued request of process `pid`'s `sequence`th update: its pid, when it started
// (so that a request outlives no reuse of the pid) and the sequence.
std::string RequestName(pid_t pid, unsigned sequence);

// Sets the fields of the share's record that `fields` sets, keeping the others (the record is
// added when missing), through ApplyUpdates. 0, or -1 as ApplyUpdates.
int UpdateShareRecord(const std::string& share, const ShareFields& fields);

// Records a task's heartbeat (`status`: epoch seconds, or "idle") under `key`, through
// ApplyUpdates. 0, or -1 as ApplyUpdates.
int RecordTaskStatus(const std::string& key, const std::string& status);

// Records `clientID` in the multi-client scheme: its client section and the marker in the pairing
// section (whose other keys stay), in one write through ApplyUpdates; what
// S2SServerUpdatePairInfo does in two. 0, or -1 as ApplyUpdates.
int RecordClient(const std::string& clientID, const std::string& serverName);

}  // namespace PairingStore
}  // namespace S2S

#endif  // S2S_HOST_PAIRING_STORE_H
