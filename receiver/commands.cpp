// The receiver's command handlers: a strict reader of untrusted command files and the six
// commands on top of the pairing store. Answers are result codes (docs/protocol.md); nothing here
// writes files: the hooks put the answer into the spool.
#include <strings.h>

#include <cctype>
#include <cstring>
#include <ctime>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "core/protocol.h"
#include "host/pairing_store.h"
#include "platform/records.h"
#include "receiver/internal.h"
#include "s2s_logger.h"
#include "s2s_platform.h"
#include "s2s_receiver.h"
#include "s2s_server.h"

namespace S2S {

namespace {

constexpr size_t kMaxKey = 64;
constexpr size_t kMaxClientID = 35;  // the pairing store reads client IDs into 36 bytes
constexpr size_t kMaxServerName = 255;
// What clients may create in the store: client sections, and task sections per client. With the
// longest names a client can send, these bounds keep the store well below the size its reader
// takes (every write is also refused when it would pass that size).
constexpr int kMaxClients = 256;
constexpr int kMaxTasksPerClient = 64;

// The answers are the exchange's own numbers.
static_assert(protocol::Is(kReceiverOK, protocol::kOK), "");
static_assert(protocol::Is(kReceiverUnknownCommand, protocol::kUnknownCommand), "");
static_assert(protocol::Is(kReceiverMissingKey, protocol::kMissingKey), "");
static_assert(protocol::Is(kReceiverUnknownKey, protocol::kUnknownKey), "");
static_assert(protocol::Is(kReceiverMalformed, protocol::kMalformed), "");
static_assert(protocol::Is(kReceiverBadName, protocol::kBadName), "");
static_assert(protocol::Is(kReceiverStoreWrite, protocol::kStoreWrite), "");
static_assert(protocol::Is(kReceiverStoreRead, protocol::kStoreRead), "");
static_assert(protocol::Is(kReceiverPairedOther, protocol::kPairedOther), "");
static_assert(protocol::Is(kReceiverNotPaired, protocol::kNotPaired), "");
static_assert(protocol::Is(kReceiverNoShare, protocol::kNoShare), "");
static_assert(protocol::Is(kReceiverAttrMismatch, protocol::kAttrMismatch), "");
static_assert(protocol::Is(kReceiverBadFinishType, protocol::kBadFinishType), "");
static_assert(protocol::Is(kReceiverShareConflict, protocol::kShareConflict), "");
static_assert(protocol::Is(kReceiverInternal, protocol::kInternal), "");
static_assert(protocol::Is(kReceiverStoreFull, protocol::kStoreFull), "");

typedef std::map<std::string, std::string> Pairs;
using PairingStore::kMultiClientMarker;
using PairingStore::ShareFields;
using PairingStore::StoreContents;

using Hash = HashRecord;
using List = ListRecord;

bool ValidKey(const std::string& key) {
    if (key.empty() || key.size() > kMaxKey || !std::isalpha(static_cast<unsigned char>(key[0]))) {
        return false;
    }
    for (unsigned char c : key) {
        if (!(std::isalnum(c) || c == '_')) {
            return false;
        }
    }
    return true;
}

// The multi-client marker stands in the store's client ID for "many clients": as a client's
// own ID it would count as paired without pairing and bind shares to nobody.
bool ReservedClientID(const std::string& id) {
    return strcasecmp(id.c_str(), kMultiClientMarker) == 0;
}

bool ValidClientID(const std::string& id) {
    if (id.empty() || id.size() > kMaxClientID || ReservedClientID(id)) {
        return false;
    }
    for (unsigned char c : id) {
        if (!(std::isalnum(c) || c == ':' || c == '-' || c == '_' || c == '.')) {
            return false;
        }
    }
    return true;
}

bool ValidServerName(const std::string& name) {
    return !name.empty() && name.size() <= kMaxServerName && !protocol::HasControl(name) &&
           name.find_first_of("\"'\\") == std::string::npos;
}

bool YesNo(const std::string& v, bool* out) {
    if (v == protocol::kYes || v == protocol::kNo) {
        *out = v == protocol::kYes;
        return true;
    }
    return false;
}

bool ZeroOne(const std::string& v) {
    return v == protocol::kZero || v == protocol::kOne;
}

bool Decimal(const std::string& v) {
    if (v.empty() || v.size() > 9) {
        return false;
    }
    for (unsigned char c : v) {
        if (!std::isdigit(c)) {
            return false;
        }
    }
    return true;
}

std::string Now() {
    return std::to_string(static_cast<long long>(time(nullptr)));
}

Hash NewHash() {
    return Hash(VLIBCSzHashAlloc(16));
}

bool Set(Hash& h, const char* key, const std::string& value) {
    VLIBSzHash* raw = h.release();
    int rc = VLIBCSzHashSetValue(&raw, key, value.c_str());
    h.reset(raw);
    return rc >= 0;
}

// The answer to a failed store write: the store is full (nothing was written), or it failed.
int StoreWriteFailure() {
    return VLIBCErrGet() == VLIB_ERR_TOO_LARGE ? protocol::kStoreFull : protocol::kStoreWrite;
}

// The store as it is now, for one decision. False when it cannot be read; `*missing` tells
// whether that is because it has no file at all.
bool LoadStore(StoreContents* store, bool* missing = nullptr) {
    if (PairingStore::ReadStore(store) == 0) {
        return true;
    }
    if (missing != nullptr) {
        *missing = VLIBCErrGet() == VLIB_ERR_FILE_NOT_FOUND;
    }
    return false;
}

// Whether the store may take one more record: it holds `existing` already, or fewer than `limit`
// of its kind (`count`, `kind` names them in the warning). 0 (yes) or 216 (no).
int RoomFor(bool existing, int count, const std::string& kind, int limit) {
    if (existing || count < limit) {
        return protocol::kOK;
    }
    Logger::LogMsg(Logger::Warning,
                   "[WARNING] receiver_commands.cpp(%d): the pairing store holds %d sections "
                   "'%s...' already (at most %d)\n",
                   __LINE__, count, kind.c_str(), limit);
    return protocol::kStoreFull;
}

// Whether `id` paired with this server, in either scheme. -1 when the store cannot be read.
int ClientPaired(const std::string& id) {
    StoreContents store;
    if (!LoadStore(&store)) {
        return -1;
    }
    if (store.pairedClientID == id && !ReservedClientID(id)) {
        return 1;
    }
    return store.FindClient(id) != nullptr ? 1 : 0;
}

// Binding checks through the store: 0, 214 (refused shares in `*refused`), 201 or 206.
int CheckShares(const std::vector<std::string>& shares, const std::string& clientID,
                std::vector<std::string>* refused) {
    List in(VLIBCSzListAlloc(static_cast<int>(shares.size()) + 1));
    List out(VLIBCSzListAlloc(8));
    if (!in || !out) {
        return protocol::kInternal;
    }
    for (const auto& s : shares) {
        VLIBSzList* raw = in.release();
        int rc = VLIBCSzListPush(&raw, s.c_str());
        in.reset(raw);
        if (rc < 0) {
            return protocol::kInternal;
        }
    }
    VLIBSzList* rawOut = out.release();
    int rc = S2SCheckIfSharePaired(in.get(), clientID.c_str(), &rawOut);
    out.reset(rawOut);
    if (refused != nullptr) {
        refused->clear();
        for (int i = 0; i < VLIBCSzListCount(out.get()); ++i) {
            refused->push_back(VLIBCSzListGet(out.get(), i));
        }
    }
    return rc;
}

// Sets the share's fields. Every store write is a synced rewrite of the file, so a write that
// would change nothing is skipped: a resync sends the same pairing, start and finish each time.
// A store that cannot be read is written.
int UpdateShare(const std::string& share, const ShareFields& fields) {
    StoreContents store;
    if (LoadStore(&store)) {
        const PairingStore::StoreShare* held = store.FindShare(share);
        if (held != nullptr && held->fields.Holds(fields)) {
            return protocol::kOK;
        }
    }
    return PairingStore::UpdateShareRecord(share, fields) == 0 ? protocol::kOK
                                                               : StoreWriteFailure();
}

// The share's completed ID as stored, "" when absent. Binding writes it back with the running
// ID: the store reads a share without a completed ID as free, whatever its running ID says.
std::string CompleteID(const std::string& share) {
    StoreContents store;
    const PairingStore::StoreShare* held = LoadStore(&store) ? store.FindShare(share) : nullptr;
    // The store's readers take IDs of at most kMaxClientID bytes; a longer one reads as none.
    return held != nullptr && held->fields.completeID &&
                   held->fields.completeID->size() <= kMaxClientID
               ? *held->fields.completeID
               : std::string();
}

// Records `clientID` in the multi-client scheme, moving an older single client first.
int RecordMultiClient(const std::string& clientID, const std::string& serverName) {
    int old = S2SServerIfOldClientPaired();
    if (old < 0) {
        return protocol::kStoreRead;
    }
    StoreContents store;
    bool missing = false;
    if (!LoadStore(&store, &missing) && !missing) {
        return protocol::kStoreRead;
    }
    const PairingStore::StoreClient* known = store.FindClient(clientID);
    if (old == 0 && known != nullptr && known->serverName == serverName &&
        store.pairedClientID == kMultiClientMarker &&
        store.pairedServerName == kMultiClientMarker) {
        return protocol::kOK;
    }
    int room = RoomFor(known != nullptr, static_cast<int>(store.clients.size()),
                       PairingStore::kClientSectionPrefix, kMaxClients);
    if (room != protocol::kOK) {
        return room;
    }
    if (old == 1 && s2s_svr_reset_pair() != 0) {
        return StoreWriteFailure();
    }
    return PairingStore::RecordClient(clientID, serverName) == 0 ? protocol::kOK
                                                                 : StoreWriteFailure();
}

// Brings the daemon's share modules up to date with the share registry: a share registered
// (or removed) after the daemon was configured is served (or no longer served) from this moment
// on, since the daemon reads its configuration afresh for every connection. Every run pairs
// before its first dry run or data run, and every share start asks again. A failure is logged;
// the command itself still stands.
void RefreshModules() {
    std::string error;
    if (receiver_internal::RefreshShareModules(&error) != 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] receiver_commands.cpp(%d): the share modules were not brought up "
                       "to date: %s\n",
                       __LINE__, error.c_str());
    }
}

class Command {
  public:
    Command(const Pairs& pairs, bool oldServer) : pairs_(pairs), oldServer_(oldServer) {}

    // Checks the key set: every required key present and non-empty, no key outside
    // required + optional. 0, 201 or 202.
    int Keys(const std::set<std::string>& required, const std::set<std::string>& optional) const {
        for (const auto& p : pairs_) {
            if (p.first == protocol::kKeyCommand || p.first == protocol::kKeyClientID) {
                continue;
            }
            if (required.count(p.first) == 0 && optional.count(p.first) == 0) {
                return protocol::kUnknownKey;
            }
        }
        for (const auto& k : required) {
            auto it = pairs_.find(k);
            if (it == pairs_.end() || it->second.empty()) {
                return protocol::kMissingKey;
            }
        }
        return protocol::kOK;
    }
    const std::string& Get(const std::string& key) const {
        static const std::string kEmpty;
        auto it = pairs_.find(key);
        return it == pairs_.end() ? kEmpty : it->second;
    }
    bool Has(const std::string& key) const { return pairs_.count(key) != 0; }
    const std::string& Client() const { return Get(protocol::kKeyClientID); }
    bool OldServer() const { return oldServer_; }

  private:
    const Pairs& pairs_;
    bool oldServer_;
};

int GetProtocolVer(const Command& c, ReceiverAnswer* a) {
    if (c.OldServer()) {
        return protocol::kUnknownCommand;
    }
    int rc = c.Keys({protocol::kKeyOutfile}, {});
    if (rc != 0) {
        return rc;
    }
    a->hasOutput = true;
    a->output = std::to_string(S2S_RECEIVER_PROTOCOL_VERSION) + "\n";
    return protocol::kOK;
}

// Both pairing commands carry exactly `keys`, among them "dryRun" as yes or no and a server name
// the store can hold: 0 with *dryRun set, else the command's answer (a key missing or unknown,
// or malformed).
int CheckPairingKeys(const Command& c, const std::set<std::string>& keys, bool* dryRun) {
    int rc = c.Keys(keys, {});
    if (rc != 0) {
        return rc;
    }
    return YesNo(c.Get(protocol::kKeyDryRun), dryRun) &&
                   ValidServerName(c.Get(protocol::kKeyServerName))
               ? 0
               : protocol::kMalformed;
}

int Pairing(const Command& c) {
    bool dryRun = false;
    int rc = CheckPairingKeys(c, {protocol::kKeyDryRun, protocol::kKeyServerName}, &dryRun);
    if (rc != 0) {
        return rc;
    }
    const std::string& serverName = c.Get(protocol::kKeyServerName);
    StoreContents store;
    if (!LoadStore(&store)) {
        return protocol::kStoreRead;
    }
    // The client recorded by the single-client scheme ("" when none, the marker when the store
    // is multi-client).
    const std::string& single = store.pairedClientID;
    bool multi = single == kMultiClientMarker;
    if (!multi && !single.empty() && single != c.Client()) {
        return protocol::kPairedOther;
    }
    RefreshModules();
    if (dryRun) {
        return protocol::kOK;
    }
    if (multi || !c.OldServer()) {
        return RecordMultiClient(c.Client(), serverName);
    }
    // The pairing section's own keys, as the store's single-client setter takes them.
    Hash h = NewHash();
    if (!h || !Set(h, protocol::kKeyClientID, c.Client()) ||
        !Set(h, protocol::kKeyServerName, serverName)) {
        return protocol::kInternal;
    }
    rc = S2SServerSetPairValue(h.get());
    return rc == 0 ? protocol::kOK : StoreWriteFailure();
}

int PairingMultiSrc(const Command& c, ReceiverAnswer* a) {
    if (c.OldServer()) {
        return protocol::kUnknownCommand;
    }
    bool dryRun = false;
    int rc = CheckPairingKeys(c,
                              {protocol::kKeyServerName, protocol::kKeySyncShares,
                               protocol::kKeyDryRun, protocol::kKeyOutfile},
                              &dryRun);
    if (rc != 0) {
        return rc;
    }
    const std::string& serverName = c.Get(protocol::kKeyServerName);
    std::vector<std::string> shares;
    const std::string& joined = c.Get(protocol::kKeySyncShares);
    size_t start = 0;
    for (;;) {
        size_t end = joined.find(protocol::kShareSeparator, start);
        std::string name = joined.substr(start, end == std::string::npos ? end : end - start);
        if (!protocol::ShareNameSyncable(name)) {
            return protocol::kBadName;
        }
        shares.push_back(name);
        if (end == std::string::npos) {
            break;
        }
        start = end + 1;
    }
    std::vector<std::string> refused;
    rc = CheckShares(shares, c.Client(), &refused);
    if (rc != protocol::kOK && rc != protocol::kShareConflict) {
        return rc == protocol::kStoreRead ? protocol::kStoreRead : protocol::kInternal;
    }
    RefreshModules();
    a->hasOutput = true;
    for (size_t i = 0; i < refused.size(); ++i) {
        a->output += (i == 0 ? "" : std::string(1, protocol::kShareSeparator)) + refused[i];
    }
    a->output += "\n";
    if (!dryRun) {
        int recorded = RecordMultiClient(c.Client(), serverName);
        if (recorded != protocol::kOK) {
            return recorded;
        }
    }
    return rc;
}

const std::set<std::string> kAttributeKeys = {protocol::kKeyIsEncrypt, protocol::kKeyIsAutomount,
                                              protocol::kKeyIsEnableACL, protocol::kKeyIsWinShare,
                                              protocol::kKeyLenEncKey};

// The share must exist here, the client must have paired, and no other client may hold it.
int ShareForClient(const Command& c, const std::string& share, bool* encrypted) {
    if (!protocol::ShareNameSyncable(share)) {
        return protocol::kBadName;
    }
    int known = receiver_internal::ShareEncrypted(share, encrypted);
    if (known < 0) {
        return protocol::kInternal;
    }
    if (known == 0) {
        return protocol::kNoShare;
    }
    int paired = ClientPaired(c.Client());
    if (paired < 0) {
        return protocol::kStoreRead;
    }
    if (paired == 0) {
        return protocol::kNotPaired;
    }
    int rc = CheckShares({share}, c.Client(), nullptr);
    if (rc == protocol::kStoreRead) {
        return protocol::kStoreRead;
    }
    return rc == 0 || rc == protocol::kShareConflict ? rc : protocol::kInternal;
}

int SyncStart(const Command& c) {
    bool withAttributes = false;
    for (const auto& k : kAttributeKeys) {
        withAttributes = withAttributes || c.Has(k);
    }
    if (withAttributes && c.OldServer()) {
        return protocol::kUnknownKey;
    }
    std::set<std::string> required = {protocol::kKeyVolumeName, protocol::kKeyShareName};
    if (withAttributes) {
        required.insert(kAttributeKeys.begin(), kAttributeKeys.end());
    }
    int rc = c.Keys(required, {});
    if (rc != 0) {
        return rc;
    }
    if (!ValidServerName(c.Get(protocol::kKeyVolumeName))) {
        return protocol::kMalformed;
    }
    if (withAttributes &&
        !(ZeroOne(c.Get(protocol::kKeyIsEncrypt)) && ZeroOne(c.Get(protocol::kKeyIsAutomount)) &&
          ZeroOne(c.Get(protocol::kKeyIsEnableACL)) && ZeroOne(c.Get(protocol::kKeyIsWinShare)) &&
          Decimal(c.Get(protocol::kKeyLenEncKey)))) {
        return protocol::kMalformed;
    }
    const std::string& share = c.Get(protocol::kKeyShareName);
    bool encrypted = false;
    rc = ShareForClient(c, share, &encrypted);
    if (rc != protocol::kOK) {
        return rc;
    }
    if (withAttributes && encrypted != (c.Get(protocol::kKeyIsEncrypt) == protocol::kOne)) {
        return protocol::kAttrMismatch;
    }
    RefreshModules();
    ShareFields bound;
    bound.runningID = c.Client();
    bound.completeID = CompleteID(share);
    bound.lastStart = Now();
    return UpdateShare(share, bound);
}

int SyncFinish(const Command& c) {
    int rc = c.Keys({protocol::kKeyFinishType, protocol::kKeyName}, {});
    if (rc != 0) {
        return rc;
    }
    const std::string& type = c.Get(protocol::kKeyFinishType);
    if (type != protocol::kFinishComplete && type != protocol::kFinishAbort &&
        type != protocol::kFinishUnpair) {
        return protocol::kBadFinishType;
    }
    bool encrypted = false;
    const std::string& share = c.Get(protocol::kKeyName);
    rc = ShareForClient(c, share, &encrypted);
    if (rc != protocol::kOK) {
        return rc;
    }
    // Every finish records what became of the client's sync and when, for the status.
    ShareFields finished;
    finished.lastResult = type;
    finished.lastTime = Now();
    if (type == protocol::kFinishComplete) {
        finished.runningID = c.Client();
        finished.completeID = c.Client();
    } else if (type == protocol::kFinishUnpair) {
        finished.runningID = "";
        finished.completeID = "";
    } else {
        finished.runningID = c.Client();
        finished.completeID = CompleteID(share);
    }
    return UpdateShare(share, finished);
}

int UpdateTaskStatus(const Command& c) {
    int rc = c.Keys({protocol::kKeyTaskName}, {});
    if (rc != 0) {
        return rc;
    }
    const std::string& task = c.Get(protocol::kKeyTaskName);
    if (!ReceiverTaskNameValid(task)) {
        return protocol::kBadName;
    }
    int paired = ClientPaired(c.Client());
    if (paired <= 0) {
        return paired < 0 ? protocol::kStoreRead : protocol::kNotPaired;
    }
    // Tasks of different clients may share a name: the client ID keeps their heartbeats apart.
    std::string key = c.Client() + "/" + task;
    StoreContents store;
    bool missing = false;
    if (!LoadStore(&store, &missing) && !missing) {
        return protocol::kStoreRead;
    }
    int room = RoomFor(store.FindTask(key) != nullptr, store.CountTasks(c.Client() + "/"),
                       PairingStore::kTaskSectionPrefix + c.Client() + "/", kMaxTasksPerClient);
    if (room != protocol::kOK) {
        return room;
    }
    return PairingStore::RecordTaskStatus(key, Now()) == 0 ? protocol::kOK : StoreWriteFailure();
}

}  // namespace

namespace receiver_internal {

int ParseCommandFile(const std::string& input, std::string* token, Pairs* pairs) {
    token->clear();
    pairs->clear();
    std::vector<std::string> lines;
    size_t start = 0;
    bool unterminated = false;  // every line ends with a line break, the last one too
    while (start < input.size()) {
        size_t end = input.find('\n', start);
        if (end == std::string::npos) {
            end = input.size();
            unterminated = true;
        }
        lines.push_back(input.substr(start, end - start));
        start = end + 1;
    }
    // The token comes first so that even a malformed command gets its answer.
    if (!lines.empty()) {
        *token = protocol::TokenOfLine(lines[0]);
    }
    if (token->empty() || unterminated || input.size() > protocol::kMaxCommandFile) {
        return protocol::kMalformed;
    }
    std::vector<std::pair<std::string, std::string>> ordered;
    for (const auto& line : lines) {
        size_t eq = line.find("=\"");
        if (eq == std::string::npos || line.size() < eq + 3 || line.back() != '"' ||
            !ValidKey(line.substr(0, eq))) {
            return protocol::kMalformed;
        }
        ordered.push_back(
            std::make_pair(line.substr(0, eq), line.substr(eq + 2, line.size() - eq - 3)));
    }
    if (token->empty()) {
        return protocol::kMalformed;
    }
    if (ordered.size() < 3 || ordered[0].first != protocol::kKeyToken ||
        ordered[1].first != protocol::kKeyCommand || ordered[2].first != protocol::kKeyClientID) {
        return protocol::kMalformed;
    }
    for (size_t i = 1; i < ordered.size(); ++i) {
        if (!pairs->insert(ordered[i]).second) {
            return protocol::kMalformed;  // a key given twice
        }
    }
    return protocol::kOK;
}

}  // namespace receiver_internal

// The exported rule is the exchange's own.
const char kReceiverTaskNameRule[] = S2S_TASK_NAME_RULE;

bool ReceiverTaskNameValid(const std::string& name) {
    return protocol::TaskNameValid(name);
}

ReceiverAnswer ReceiverRunCommand(const std::string& input, bool oldServer) {
    ReceiverAnswer answer;
    Pairs pairs;
    int rc = receiver_internal::ParseCommandFile(input, &answer.token, &pairs);
    if (rc == protocol::kOK) {
        const std::string& name = pairs[protocol::kKeyCommand];
        const std::string& client = pairs[protocol::kKeyClientID];
        Command c(pairs, oldServer);
        if (!ValidClientID(client)) {
            rc = protocol::kMalformed;
        } else {
            // Control characters are never part of a value; share and task names are refused
            // with their own code.
            for (const auto& p : pairs) {
                bool nameKey = p.first == protocol::kKeyShareName ||
                               p.first == protocol::kKeySyncShares ||
                               p.first == protocol::kKeyName || p.first == protocol::kKeyTaskName;
                if (protocol::HasControl(p.second)) {
                    rc = nameKey ? protocol::kBadName : protocol::kMalformed;
                }
            }
        }
        if (rc == protocol::kOK) {
            if (name == protocol::kGetProtocolVer) {
                rc = GetProtocolVer(c, &answer);
            } else if (name == protocol::kPairing) {
                rc = Pairing(c);
            } else if (name == protocol::kPairingMultiSrc) {
                rc = PairingMultiSrc(c, &answer);
            } else if (name == protocol::kSyncStart) {
                rc = SyncStart(c);
            } else if (name == protocol::kSyncFinish) {
                rc = SyncFinish(c);
            } else if (name == protocol::kUpdateTaskStatus) {
                rc = UpdateTaskStatus(c);
            } else {
                rc = protocol::kUnknownCommand;
            }
        }
        const char* shownName =
            protocol::HasControl(name) || name.size() > kMaxKey ? "?" : name.c_str();
        const char* shownClient = ValidClientID(client) ? client.c_str() : "?";
        if (rc == protocol::kOK) {
            Logger::LogMsg(Logger::Info, "[INFO] receiver_commands.cpp(%d): %s from client %s\n",
                           __LINE__, shownName, shownClient);
        } else {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] receiver_commands.cpp(%d): %s from client %s refused [%d]\n",
                           __LINE__, shownName, shownClient, rc);
        }
    }
    answer.result = rc;
    if (rc != protocol::kOK && rc != protocol::kShareConflict) {
        answer.hasOutput = false;
        answer.output.clear();
    }
    return answer;
}

}  // namespace S2S
