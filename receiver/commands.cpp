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

#include "host/platform_records.h"
#include "receiver/internal.h"
#include "rsync/command_reply.h"
#include "s2s_logger.h"
#include "s2s_platform.h"
#include "s2s_receiver.h"
#include "s2s_server.h"

namespace S2S {

namespace {

constexpr size_t kMaxKey = 64;
constexpr size_t kMaxClientID = 35;  // the pairing store reads client IDs into 36 bytes
constexpr size_t kMaxServerName = 255;
constexpr const char* kMultiMarker = "S2SMULTI-SRC-SUPPORT";
// What clients may create in the store: client sections, and task sections per client. With the
// longest names a client can send, these bounds keep the store well below the size its reader
// takes (every write is also refused when it would pass that size).
constexpr int kMaxClients = 256;
constexpr int kMaxTasksPerClient = 64;

typedef std::map<std::string, std::string> Pairs;

using Hash = HashRecord;
using List = ListRecord;

bool HasControl(const std::string& s) {
    for (unsigned char c : s) {
        if (c < 0x20 || c == 0x7f) {
            return true;
        }
    }
    return false;
}

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

// The multi-client marker stands in the store's "clientID" for "many clients": as a client's
// own ID it would count as paired without pairing and bind shares to nobody.
bool ReservedClientID(const std::string& id) {
    return strcasecmp(id.c_str(), kMultiMarker) == 0;
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
    return !name.empty() && name.size() <= kMaxServerName && !HasControl(name) &&
           name.find_first_of("\"'\\") == std::string::npos;
}

bool YesNo(const std::string& v, bool* out) {
    if (v == "yes" || v == "no") {
        *out = v == "yes";
        return true;
    }
    return false;
}

bool ZeroOne(const std::string& v) {
    return v == "0" || v == "1";
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
    return VLIBCErrGet() == VLIB_ERR_TOO_LARGE ? kReceiverStoreFull : kReceiverStoreWrite;
}

// Whether the store may take one more section starting with `prefix` when it does not hold
// `section` yet: fewer than `limit` such sections. 0 (yes), 216 (no) or 206.
int RoomFor(const std::string& section, const std::string& prefix, int limit) {
    List names(VLIBCSzListAlloc(64));
    if (!names) {
        return kReceiverInternal;
    }
    VLIBSzList* raw = names.release();
    S2SCheckServerInfo();
    int count = VLIBCFileEnumSection(S2SPath(S2S_PATH_PAIRING_STORE), &raw);
    names.reset(raw);
    if (count < 0) {
        return VLIBCErrGet() == VLIB_ERR_FILE_NOT_FOUND ? kReceiverOK : kReceiverStoreRead;
    }
    int same = 0;
    for (int i = 0; i < VLIBCSzListCount(names.get()); ++i) {
        const std::string name = VLIBCSzListGet(names.get(), i);
        if (name == section) {
            return kReceiverOK;
        }
        same += name.compare(0, prefix.size(), prefix) == 0;
    }
    if (same >= limit) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] receiver_commands.cpp(%d): the pairing store holds %d sections "
                       "'%s...' already (at most %d)\n",
                       __LINE__, same, prefix.c_str(), limit);
        return kReceiverStoreFull;
    }
    return kReceiverOK;
}

// The client recorded in "PairedClientInfo" by the single-client scheme ("" when none, the
// marker when the store is multi-client). False when the store cannot be read.
bool SingleClient(std::string* id) {
    Hash h = NewHash();
    if (!h) {
        return false;
    }
    VLIBSzHash* raw = h.release();
    int rc = S2SGetServerInfo("PairedClientInfo", &raw);
    h.reset(raw);
    if (rc < 0) {
        return false;
    }
    const char* v = VLIBCSzHashGetValue(h.get(), "clientID");
    *id = v != nullptr ? v : "";
    return true;
}

// Whether `id` paired with this server, in either scheme. -1 when the store cannot be read.
int ClientPaired(const std::string& id) {
    std::string single;
    if (!SingleClient(&single)) {
        return -1;
    }
    if (single == id && !ReservedClientID(id)) {
        return 1;
    }
    Hash h = NewHash();
    if (!h) {
        return -1;
    }
    VLIBSzHash* raw = h.release();
    int rc = S2SGetServerInfo(("CLIENTID_" + id).c_str(), &raw);
    h.reset(raw);
    return rc < 0 ? -1 : (rc > 0 ? 1 : 0);
}

// Binding checks through the store: 0, 214 (refused shares in `*refused`), 201 or 206.
int CheckShares(const std::vector<std::string>& shares, const std::string& clientID,
                std::vector<std::string>* refused) {
    List in(VLIBCSzListAlloc(static_cast<int>(shares.size()) + 1));
    List out(VLIBCSzListAlloc(8));
    if (!in || !out) {
        return kReceiverInternal;
    }
    for (const auto& s : shares) {
        VLIBSzList* raw = in.release();
        int rc = VLIBCSzListPush(&raw, s.c_str());
        in.reset(raw);
        if (rc < 0) {
            return kReceiverInternal;
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

// True when `section` of the store already holds every pair of `kv`. Every store write is a
// synced rewrite of the file, so a write that would change nothing is skipped: a resync sends the
// same pairing, start and finish each time. False (write) when the store cannot be read.
bool StoreHolds(const std::string& section,
                const std::vector<std::pair<const char*, std::string>>& kv) {
    Hash h = NewHash();
    if (!h) {
        return false;
    }
    VLIBSzHash* raw = h.release();
    int rc = S2SGetServerInfo(section.c_str(), &raw);
    h.reset(raw);
    if (rc <= 0) {
        return false;
    }
    for (const auto& p : kv) {
        const char* v = VLIBCSzHashGetValue(h.get(), p.first);
        if (v == nullptr || p.second != v) {
            return false;
        }
    }
    return true;
}

int UpdateShare(const std::string& share,
                const std::vector<std::pair<const char*, std::string>>& kv) {
    if (StoreHolds("SHARE_" + share, kv)) {
        return kReceiverOK;
    }
    Hash h = NewHash();
    if (!h) {
        return kReceiverInternal;
    }
    for (const auto& p : kv) {
        if (!Set(h, p.first, p.second)) {
            return kReceiverInternal;
        }
    }
    return S2SServerUpdateShare(share.c_str(), h.get()) == 0 ? kReceiverOK : StoreWriteFailure();
}

// The share's "CompleteID" as stored, "" when absent. Binding writes it back with "RunningID":
// the store reads a share without that key as free, whatever "RunningID" says.
std::string CompleteID(const std::string& share) {
    char buf[kMaxClientID + 1];
    if (S2SServerGetShare(share.c_str(), "CompleteID", buf, sizeof buf) < 0) {
        return std::string();
    }
    return buf;
}

// Records `clientID` in the multi-client scheme, moving an older single client first.
int RecordMultiClient(const std::string& clientID, const std::string& serverName) {
    int old = S2SServerIfOldClientPaired();
    if (old < 0) {
        return kReceiverStoreRead;
    }
    if (old == 0 && StoreHolds("CLIENTID_" + clientID, {{"ServerName", serverName}}) &&
        StoreHolds("PairedClientInfo",
                   {{"clientID", kMultiMarker}, {"serverName", kMultiMarker}})) {
        return kReceiverOK;
    }
    int room = RoomFor("CLIENTID_" + clientID, "CLIENTID_", kMaxClients);
    if (room != kReceiverOK) {
        return room;
    }
    if (old == 1 && s2s_svr_reset_pair() != 0) {
        return StoreWriteFailure();
    }
    int rc = S2SServerUpdatePairInfo(clientID.c_str(), serverName.c_str());
    return rc == 0 ? kReceiverOK : StoreWriteFailure();
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
            if (p.first == "command" || p.first == "clientID") {
                continue;
            }
            if (required.count(p.first) == 0 && optional.count(p.first) == 0) {
                return kReceiverUnknownKey;
            }
        }
        for (const auto& k : required) {
            auto it = pairs_.find(k);
            if (it == pairs_.end() || it->second.empty()) {
                return kReceiverMissingKey;
            }
        }
        return kReceiverOK;
    }
    const std::string& Get(const std::string& key) const {
        static const std::string kEmpty;
        auto it = pairs_.find(key);
        return it == pairs_.end() ? kEmpty : it->second;
    }
    bool Has(const std::string& key) const { return pairs_.count(key) != 0; }
    const std::string& Client() const { return Get("clientID"); }
    bool OldServer() const { return oldServer_; }

  private:
    const Pairs& pairs_;
    bool oldServer_;
};

int GetProtocolVer(const Command& c, ReceiverAnswer* a) {
    if (c.OldServer()) {
        return kReceiverUnknownCommand;
    }
    int rc = c.Keys({"outfile"}, {});
    if (rc != 0) {
        return rc;
    }
    a->hasOutput = true;
    a->output = std::to_string(S2S_RECEIVER_PROTOCOL_VERSION) + "\n";
    return kReceiverOK;
}

int Pairing(const Command& c) {
    int rc = c.Keys({"dryRun", "serverName"}, {});
    if (rc != 0) {
        return rc;
    }
    bool dryRun = false;
    if (!YesNo(c.Get("dryRun"), &dryRun) || !ValidServerName(c.Get("serverName"))) {
        return kReceiverMalformed;
    }
    std::string single;
    if (!SingleClient(&single)) {
        return kReceiverStoreRead;
    }
    bool multi = single == kMultiMarker;
    if (!multi && !single.empty() && single != c.Client()) {
        return kReceiverPairedOther;
    }
    RefreshModules();
    if (dryRun) {
        return kReceiverOK;
    }
    if (multi || !c.OldServer()) {
        return RecordMultiClient(c.Client(), c.Get("serverName"));
    }
    Hash h = NewHash();
    if (!h || !Set(h, "clientID", c.Client()) || !Set(h, "serverName", c.Get("serverName"))) {
        return kReceiverInternal;
    }
    rc = S2SServerSetPairValue(h.get());
    return rc == 0 ? kReceiverOK : StoreWriteFailure();
}

int PairingMultiSrc(const Command& c, ReceiverAnswer* a) {
    if (c.OldServer()) {
        return kReceiverUnknownCommand;
    }
    int rc = c.Keys({"serverName", "syncShares", "dryRun", "outfile"}, {});
    if (rc != 0) {
        return rc;
    }
    bool dryRun = false;
    if (!YesNo(c.Get("dryRun"), &dryRun) || !ValidServerName(c.Get("serverName"))) {
        return kReceiverMalformed;
    }
    std::vector<std::string> shares;
    const std::string& joined = c.Get("syncShares");
    size_t start = 0;
    for (;;) {
        size_t end = joined.find(':', start);
        std::string name = joined.substr(start, end == std::string::npos ? end : end - start);
        if (!receiver_internal::ValidShareName(name)) {
            return kReceiverBadName;
        }
        shares.push_back(name);
        if (end == std::string::npos) {
            break;
        }
        start = end + 1;
    }
    std::vector<std::string> refused;
    rc = CheckShares(shares, c.Client(), &refused);
    if (rc != kReceiverOK && rc != kReceiverShareConflict) {
        return rc == S2S_SVR_ERR_READ ? kReceiverStoreRead : kReceiverInternal;
    }
    RefreshModules();
    a->hasOutput = true;
    for (size_t i = 0; i < refused.size(); ++i) {
        a->output += (i == 0 ? "" : ":") + refused[i];
    }
    a->output += "\n";
    if (!dryRun) {
        int recorded = RecordMultiClient(c.Client(), c.Get("serverName"));
        if (recorded != kReceiverOK) {
            return recorded;
        }
    }
    return rc;
}

const std::set<std::string> kAttributeKeys = {"isEncrypt", "isAutomount", "isEnableACL",
                                              "isWinShare", "lenEncKey"};

// The share must exist here, the client must have paired, and no other client may hold it.
int ShareForClient(const Command& c, const std::string& share, bool* encrypted) {
    if (!receiver_internal::ValidShareName(share)) {
        return kReceiverBadName;
    }
    int known = receiver_internal::ShareEncrypted(share, encrypted);
    if (known < 0) {
        return kReceiverInternal;
    }
    if (known == 0) {
        return kReceiverNoShare;
    }
    int paired = ClientPaired(c.Client());
    if (paired < 0) {
        return kReceiverStoreRead;
    }
    if (paired == 0) {
        return kReceiverNotPaired;
    }
    int rc = CheckShares({share}, c.Client(), nullptr);
    if (rc == S2S_SVR_ERR_READ) {
        return kReceiverStoreRead;
    }
    return rc == 0 || rc == kReceiverShareConflict ? rc : kReceiverInternal;
}

int SyncStart(const Command& c) {
    bool withAttributes = false;
    for (const auto& k : kAttributeKeys) {
        withAttributes = withAttributes || c.Has(k);
    }
    if (withAttributes && c.OldServer()) {
        return kReceiverUnknownKey;
    }
    int rc = withAttributes ? c.Keys({"volumeName", "shareName", "isEncrypt", "isAutomount",
                                      "isEnableACL", "isWinShare", "lenEncKey"},
                                     {})
                            : c.Keys({"volumeName", "shareName"}, {});
    if (rc != 0) {
        return rc;
    }
    if (!ValidServerName(c.Get("volumeName"))) {
        return kReceiverMalformed;
    }
    if (withAttributes && !(ZeroOne(c.Get("isEncrypt")) && ZeroOne(c.Get("isAutomount")) &&
                            ZeroOne(c.Get("isEnableACL")) && ZeroOne(c.Get("isWinShare")) &&
                            Decimal(c.Get("lenEncKey")))) {
        return kReceiverMalformed;
    }
    const std::string& share = c.Get("shareName");
    bool encrypted = false;
    rc = ShareForClient(c, share, &encrypted);
    if (rc != kReceiverOK) {
        return rc;
    }
    if (withAttributes && encrypted != (c.Get("isEncrypt") == "1")) {
        return kReceiverAttrMismatch;
    }
    RefreshModules();
    return UpdateShare(
        share,
        {{"RunningID", c.Client()}, {"CompleteID", CompleteID(share)}, {"LastStart", Now()}});
}

int SyncFinish(const Command& c) {
    int rc = c.Keys({"finishType", "name"}, {});
    if (rc != 0) {
        return rc;
    }
    const std::string& type = c.Get("finishType");
    if (type != "complete" && type != "abort" && type != "unpair") {
        return kReceiverBadFinishType;
    }
    bool encrypted = false;
    const std::string& share = c.Get("name");
    rc = ShareForClient(c, share, &encrypted);
    if (rc != kReceiverOK) {
        return rc;
    }
    // Every finish records what became of the client's sync and when, for the status.
    const std::string now = Now();
    if (type == "complete") {
        return UpdateShare(share, {{"RunningID", c.Client()},
                                   {"CompleteID", c.Client()},
                                   {"LastResult", type},
                                   {"LastTime", now}});
    }
    if (type == "unpair") {
        return UpdateShare(
            share,
            {{"RunningID", ""}, {"CompleteID", ""}, {"LastResult", type}, {"LastTime", now}});
    }
    return UpdateShare(share, {{"RunningID", c.Client()},
                               {"CompleteID", CompleteID(share)},
                               {"LastResult", type},
                               {"LastTime", now}});
}

int UpdateTaskStatus(const Command& c) {
    int rc = c.Keys({"taskName"}, {});
    if (rc != 0) {
        return rc;
    }
    const std::string& task = c.Get("taskName");
    if (!ReceiverTaskNameValid(task)) {
        return kReceiverBadName;
    }
    int paired = ClientPaired(c.Client());
    if (paired <= 0) {
        return paired < 0 ? kReceiverStoreRead : kReceiverNotPaired;
    }
    // Tasks of different clients may share a name: the client ID keeps their heartbeats apart.
    std::string key = c.Client() + "/" + task;
    int room = RoomFor("TASK_" + key, "TASK_" + c.Client() + "/", kMaxTasksPerClient);
    if (room != kReceiverOK) {
        return room;
    }
    Hash h = NewHash();
    if (!h || !Set(h, "status", Now())) {
        return kReceiverInternal;
    }
    return S2SServerUpdateTask(key.c_str(), h.get()) == 0 ? kReceiverOK : StoreWriteFailure();
}

}  // namespace

namespace receiver_internal {

bool ValidShareName(const std::string& name) {
    return VURNShareNameIsSyncable(name.c_str()) == 1;
}

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
    const std::string prefix = "token=\"";
    if (!lines.empty() && lines[0].size() == prefix.size() + 2 * command_reply::kTokenBytes + 1 &&
        lines[0].compare(0, prefix.size(), prefix) == 0 && lines[0].back() == '"') {
        std::string t = lines[0].substr(prefix.size(), 2 * command_reply::kTokenBytes);
        if (command_reply::ValidToken(t)) {
            *token = t;
        }
    }
    if (token->empty() || unterminated || input.size() > command_reply::kMaxCommandFile) {
        return kReceiverMalformed;
    }
    std::vector<std::pair<std::string, std::string>> ordered;
    for (const auto& line : lines) {
        size_t eq = line.find("=\"");
        if (eq == std::string::npos || line.size() < eq + 3 || line.back() != '"' ||
            !ValidKey(line.substr(0, eq))) {
            return kReceiverMalformed;
        }
        ordered.push_back(
            std::make_pair(line.substr(0, eq), line.substr(eq + 2, line.size() - eq - 3)));
    }
    if (token->empty()) {
        return kReceiverMalformed;
    }
    if (ordered.size() < 3 || ordered[0].first != "token" || ordered[1].first != "command" ||
        ordered[2].first != "clientID") {
        return kReceiverMalformed;
    }
    for (size_t i = 1; i < ordered.size(); ++i) {
        if (!pairs->insert(ordered[i]).second) {
            return kReceiverMalformed;  // a key given twice
        }
    }
    return kReceiverOK;
}

}  // namespace receiver_internal

const char kReceiverTaskNameRule[] =
    "the task's name is not one a receiver takes: at most 255 bytes, not empty, no control "
    "characters, quotes, brackets, slashes, backslashes or \"..\", no leading '@', no leading or "
    "trailing blank";

bool ReceiverTaskNameValid(const std::string& name) {
    return !name.empty() && name.size() <= VURN_SHARE_NAME_MAX && !HasControl(name) &&
           name.find_first_of("/\"'`[]\\") == std::string::npos &&
           name.find("..") == std::string::npos && name.front() != ' ' && name.front() != '@' &&
           name.back() != ' ';
}

ReceiverAnswer ReceiverRunCommand(const std::string& input, bool oldServer) {
    ReceiverAnswer answer;
    Pairs pairs;
    int rc = receiver_internal::ParseCommandFile(input, &answer.token, &pairs);
    if (rc == kReceiverOK) {
        const std::string& name = pairs["command"];
        const std::string& client = pairs["clientID"];
        Command c(pairs, oldServer);
        if (!ValidClientID(client)) {
            rc = kReceiverMalformed;
        } else {
            // Control characters are never part of a value; share and task names are refused
            // with their own code.
            for (const auto& p : pairs) {
                bool nameKey = p.first == "shareName" || p.first == "syncShares" ||
                               p.first == "name" || p.first == "taskName";
                if (HasControl(p.second)) {
                    rc = nameKey ? kReceiverBadName : kReceiverMalformed;
                }
            }
        }
        if (rc == kReceiverOK) {
            if (name == "S2S_GetProtocolVer") {
                rc = GetProtocolVer(c, &answer);
            } else if (name == "S2S_Pairing") {
                rc = Pairing(c);
            } else if (name == "S2S_PairingMultiSrc") {
                rc = PairingMultiSrc(c, &answer);
            } else if (name == "S2S_SyncStart") {
                rc = SyncStart(c);
            } else if (name == "S2S_SyncFinish") {
                rc = SyncFinish(c);
            } else if (name == "S2S_UpdateTaskStatus") {
                rc = UpdateTaskStatus(c);
            } else {
                rc = kReceiverUnknownCommand;
            }
        }
        const char* shownName = HasControl(name) || name.size() > kMaxKey ? "?" : name.c_str();
        const char* shownClient = ValidClientID(client) ? client.c_str() : "?";
        if (rc == kReceiverOK) {
            Logger::LogMsg(Logger::Info, "[INFO] receiver_commands.cpp(%d): %s from client %s\n",
                           __LINE__, shownName, shownClient);
        } else {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] receiver_commands.cpp(%d): %s from client %s refused [%d]\n",
                           __LINE__, shownName, shownClient, rc);
        }
    }
    answer.result = rc;
    if (rc != kReceiverOK && rc != kReceiverShareConflict) {
        answer.hasOutput = false;
        answer.output.clear();
    }
    return answer;
}

}  // namespace S2S
