// Remote commands over rsync: the command files (and the string-list helpers that build and read
// them), the version query, pairing, the connection test and the search for a reachable address,
// finishing a share's sync and the task's heartbeat.
#include <fstream>
#include <list>
#include <string>
#include <vector>

#include "core/protocol.h"
#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_rsyncer.h"

namespace S2S {

namespace {

namespace protocol = S2S::protocol;

// The sender's names for the codes it gives a meaning to are the exchange's own numbers.
static_assert(protocol::Is(kRsyncResultOK, protocol::kOK), "");
static_assert(protocol::Is(kRsyncResultNoAddress, protocol::kNoAddress), "");
static_assert(protocol::Is(kRsyncResultUnknownCmd, protocol::kUnknownCommand), "");
static_assert(protocol::Is(kRsyncResultNoVersion, protocol::kNoVersion), "");
static_assert(protocol::Is(kRsyncResultUnknownCmdAlt, protocol::kNoCommandModule), "");
static_assert(protocol::Is(kRsyncResultRetryPlain, protocol::kUnknownKey), "");
static_assert(protocol::Is(kRsyncResultDryRunOK, protocol::kPairedOther), "");
static_assert(protocol::Is(kRsyncResultNotTested, protocol::kNotTested), "");
static_assert(protocol::Is(kRsyncResultConflict, protocol::kShareConflict), "");
static_assert(protocol::Is(kRsyncResultLocalFailure, protocol::kLocalFailure), "");
static_assert(protocol::Is(Rsyncer::RsyncTask::kResultNoCommands, protocol::kNoCommandModule), "");

const char* YesNo(bool on) {
    return on ? protocol::kYes : protocol::kNo;
}

// A host name longer than this goes out with its first 35 characters dropped, not truncated:
// servers already hold names in that form.
constexpr unsigned kServerNameSkip = 35;

}  // namespace

void SplitStringByChars(const std::string& text, const std::string& separators,
                        std::list<std::string>& out) {
    std::string::size_type start = 0;
    for (;;) {
        std::string::size_type pos = text.find_first_of(separators, start);
        if (pos == std::string::npos) {
            out.push_back(text.substr(start));
            return;
        }
        out.push_back(text.substr(start, pos - start));
        start = pos + 1;
    }
}

std::string JoinItems(const std::list<std::string>& items, const std::string& separator) {
    std::string joined;
    for (std::list<std::string>::const_iterator it = items.begin(); it != items.end(); ++it) {
        if (it != items.begin()) {
            joined += separator;
        }
        joined += *it;
    }
    return joined;
}

int Rsyncer::GenCommandLines(const std::string& command, const ParamList& params,
                             std::list<std::string>& lines) {
    const std::string clientID = GetClientID();
    if (clientID.empty()) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s_rsyncer.cpp(%d): Fail to get client id\n",
                       __LINE__);
        return -1;
    }
    // Values go in verbatim (no escaping, no trimming): the server parses each line strictly and
    // refuses what it cannot take.
    lines.push_back(protocol::Line(protocol::kKeyCommand, command));
    lines.push_back(protocol::Line(protocol::kKeyClientID, clientID));
    for (ParamList::const_iterator it = params.begin(); it != params.end(); ++it) {
        lines.push_back(protocol::Line(it->first, it->second));
    }
    return 0;
}

int Rsyncer::GenServerVersionCmd(const std::string& outfile, std::list<std::string>& lines) {
    ParamList params;
    params.emplace_back(protocol::kKeyOutfile, outfile);
    return GenCommandLines(protocol::kGetProtocolVer, params, lines);
}

int Rsyncer::GenSinglePairCmd(bool dryRun, std::list<std::string>& lines) {
    return SinglePairLines(dryRun, lines);
}

int Rsyncer::SinglePairLines(bool dryRun, std::list<std::string>& lines) {
    ParamList params;
    params.emplace_back(protocol::kKeyDryRun, YesNo(dryRun));
    params.emplace_back(protocol::kKeyServerName, GetHostName(kServerNameSkip));
    return GenCommandLines(protocol::kPairing, params, lines);
}

int Rsyncer::GenPairMultiSrcCmd(bool dryRun, const std::list<std::string>& shares,
                                const std::string& outfile, std::list<std::string>& lines) const {
    if (shares.empty()) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): GenPairMultiSrcCmd: Empty parameter\n",
                       __LINE__);
        return -1;
    }
    ParamList params;
    params.emplace_back(protocol::kKeyServerName, GetHostName(kServerNameSkip));
    params.emplace_back(protocol::kKeySyncShares,
                        JoinItems(shares, std::string(1, protocol::kShareSeparator)));
    params.emplace_back(protocol::kKeyDryRun, YesNo(dryRun));
    params.emplace_back(protocol::kKeyOutfile, outfile);
    return GenCommandLines(protocol::kPairingMultiSrc, params, lines);
}

int Rsyncer::GenFinishSyncCmd(const std::string& finishType, const std::string& name,
                              std::list<std::string>& lines) const {
    if (finishType.empty() || name.empty()) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): GenFinishSyncCmd: Empty parameter\n",
                       __LINE__);
        return -1;
    }
    ParamList params;
    params.emplace_back(protocol::kKeyFinishType, finishType);
    params.emplace_back(protocol::kKeyName, name);
    return GenCommandLines(protocol::kSyncFinish, params, lines);
}

int Rsyncer::GenSendBeaconCmd(const std::string& taskName, std::list<std::string>& lines) const {
    if (taskName.empty()) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): GenSendBeaconCmd: Empty parameter\n",
                       __LINE__);
        return -1;
    }
    ParamList params;
    params.emplace_back(protocol::kKeyTaskName, taskName);
    return GenCommandLines(protocol::kUpdateTaskStatus, params, lines);
}

void Rsyncer::GetServerVersion() {
    std::string why;
    const std::string outfile = GetTempFile(why);
    if (outfile.empty()) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): GetServerVersion: Fail to get output file\n",
                       __LINE__);
        versionResult = RsyncTask::kResultLocalFile;
        lastError = why;
        return;
    }
    std::list<std::string> lines;
    if (GenServerVersionCmd(outfile, lines) < 0) {
        // The reserved output file stays behind on this path (long-standing behaviour, kept).
        Logger::LogMsg(
            Logger::Error,
            "[ERROR] s2s_rsyncer.cpp(%d): GetServerVersion: Fail to write command file\n",
            __LINE__);
        versionResult = RsyncTask::kResultUsage;
        lastError = "the version query could not be built (no client ID)";
        return;
    }
    RsyncTask task;
    InitRsyncTask(task, true);
    task.SetListOnly(true);
    const int r = task.ExecuteCmd(lines, cancelChecker);
    lastError = task.lastError();
    versionResult = 0;
    if (r == kRsyncResultUnknownCmd || r == kRsyncResultUnknownCmdAlt) {
        // A server that does not know the command predates multi-source pairing.
        serverVersion = 0;
    } else if (r != 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): Fail to get server version [%d]\n", __LINE__,
                       r);
        versionResult = r;
    } else {
        std::ifstream in(outfile.c_str());
        if (!in.is_open()) {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] s2s_rsyncer.cpp(%d): Fail to open server version file\n",
                           __LINE__);
            serverVersion = -1;
            versionResult = RsyncTask::kResultLocalFile;
            lastError = "the version reply could not be read back from " + outfile;
        } else {
            int version = -1;
            if (!(in >> version)) {
                version = -1;
            }
            serverVersion = version;
            if (version < 0) {
                versionResult = RsyncTask::kResultBadReply;
                lastError = "the server's version reply holds no version number";
            }
        }
    }
    PutTempFile(outfile);
}

void Rsyncer::RunCommandLines(const std::list<std::string>& lines, bool isTest, int& result) const {
    RsyncTask task;
    InitRsyncTask(task, isTest);
    result = task.ExecuteCmd(lines, cancelChecker);
    lastError = task.lastError();
}

int Rsyncer::DoSinglePairing(bool dryRun, int& result) const {
    std::list<std::string> lines;
    if (SinglePairLines(dryRun, lines) < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): SinglePairing: Fail to write command file\n",
                       __LINE__);
        return -1;
    }
    RunCommandLines(lines, dryRun, result);
    return 0;
}

namespace {

// Only the first line of the server's conflict file counts: share names joined with ':'.
bool ReadConflictShares(const std::string& path, std::list<std::string>& conflictShares) {
    std::ifstream in(path.c_str());
    if (!in.is_open()) {
        return false;
    }
    std::string line;
    if (std::getline(in, line) && !line.empty()) {
        SplitStringByChars(line, std::string(1, protocol::kShareSeparator), conflictShares);
    }
    return true;
}

}  // namespace

int Rsyncer::DoMultiPairing(bool dryRun, const std::list<std::string>& shares,
                            std::list<std::string>& conflictShares, int& result) const {
    if (shares.empty()) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): MultiPairing: Share list is empty\n",
                       __LINE__);
        return -1;
    }
    std::string why;
    const std::string outfile = GetTempFile(why);
    if (outfile.empty()) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): MultiPairing: Fail to get output file\n",
                       __LINE__);
        lastError = why;
        return -1;
    }
    int ret = -1;
    std::list<std::string> lines;
    if (GenPairMultiSrcCmd(dryRun, shares, outfile, lines) < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): MultiPairing: Fail to write command file\n",
                       __LINE__);
    } else {
        RsyncTask task;
        InitRsyncTask(task, dryRun);
        result = task.ExecuteCmd(lines, cancelChecker);
        lastError = task.lastError();
        // 214 lists the shares another client holds: still a complete exchange.
        if (result == 0 || result == kRsyncResultConflict) {
            if (!ReadConflictShares(outfile, conflictShares)) {
                Logger::LogMsg(Logger::Error,
                               "[ERROR] s2s_rsyncer.cpp(%d): Fail to open conflict share file\n",
                               __LINE__);
                Logger::LogMsg(Logger::Error,
                               "[ERROR] s2s_rsyncer.cpp(%d): Fail to parse out conflict shares\n",
                               __LINE__);
            } else {
                ret = 0;
            }
        } else {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] s2s_rsyncer.cpp(%d): Fail to check share pairing [%d]\n",
                           __LINE__, result);
        }
    }
    PutTempFile(outfile);
    return ret;
}

int Rsyncer::DoPairing(bool dryRun, const std::list<std::string>& shares,
                       std::list<std::string>& conflictShares, int& result) const {
    if (SupportMultiSource()) {
        return DoMultiPairing(dryRun, shares, conflictShares, result);
    }
    // An old server pairs the client as a whole and never reports conflicts.
    conflictShares.clear();
    return DoSinglePairing(dryRun, result);
}

int Rsyncer::TestProtocol(int& result) const {
    if (DoSinglePairing(true, result) < 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s_rsyncer.cpp(%d): Fail to test connection\n",
                       __LINE__);
        return -1;
    }
    if (result == kRsyncResultDryRunOK) {
        // The server answered the dry run, so the connection works.
        result = 0;
        return 0;
    }
    if (result != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s_rsyncer.cpp(%d): Fail to test connection [%d]\n",
                       __LINE__, result);
    }
    return 0;
}

int Rsyncer::TestServer() {
    int result = kRsyncResultNotTested;
    std::vector<std::string> ips;
    if (GetUsableIP(syncInfo.GetServerName(), syncInfo.GetServerIP(), ips) < 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] s2s_rsyncer.cpp(%d): Fail to lookup ip for %s(%s)\n",
                       __LINE__, syncInfo.GetServerName().c_str(), syncInfo.GetServerIP().c_str());
        return kRsyncResultNoAddress;
    }
    for (std::vector<std::string>::const_iterator it = ips.begin(); it != ips.end(); ++it) {
        Logger::LogMsg(Logger::Info, "[INFO] s2s_rsyncer.cpp(%d): Test %s is reachable\n", __LINE__,
                       it->c_str());
        syncInfo.SetServerIP(*it);
        if (TestProtocol(result) == 0 && result == 0) {
            GetServerVersion();
            if (serverVersion >= 0) {
                Logger::LogMsg(Logger::Info,
                               "[INFO] s2s_rsyncer.cpp(%d): Get server version [%d]\n", __LINE__,
                               serverVersion);
                return 0;
            }
        }
    }
    // A version learnt by an earlier initialisation still counts.
    if (serverVersion >= 0) {
        return 0;
    }
    Logger::LogMsg(Logger::Error,
                   "[ERROR] s2s_rsyncer.cpp(%d): Fail to find rsync reachable ip for %s(%s)\n",
                   __LINE__, syncInfo.GetServerName().c_str(), syncInfo.GetServerIP().c_str());
    return result;
}

int Rsyncer::FinishSync(const std::string& finishType, const std::string& name, int& result) const {
    std::list<std::string> lines;
    if (GenFinishSyncCmd(finishType, name, lines) < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): FinishSync: Fail to write command file\n",
                       __LINE__);
        return -1;
    }
    RunCommandLines(lines, false, result);
    return 0;
}

int Rsyncer::SendBeacon(const std::string& taskName, int& result) const {
    std::list<std::string> lines;
    if (GenSendBeaconCmd(taskName, lines) < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_rsyncer.cpp(%d): SendBeacon: Fail to write command file\n",
                       __LINE__);
        return -1;
    }
    RunCommandLines(lines, false, result);
    return 0;
}

}  // namespace S2S
