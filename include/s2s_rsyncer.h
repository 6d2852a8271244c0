// Rsyncer: the sending side's handle on one sync server for one task. It finds a reachable
// address of the server and its protocol version, pairs shares, announces and finishes a share's
// sync, pushes share data and encryption keys with rsync, and reports the task's status. Control
// requests travel to the server as small command files of key="value" lines inside rsync runs;
// the server answers with the run's result code and, for two commands, an output file.
//
// Every operation runs on the caller's thread and blocks it until rsync ends, times out or is
// cancelled through the cancel checker. One Rsyncer belongs to one thread.
#ifndef S2S_RSYNCER_H
#define S2S_RSYNCER_H

#include <boost/function.hpp>
#include <list>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "s2s_export.h"
#include "s2s_host.h"
#include "s2s_rsync_wrapper.h"
#include "s2s_sync_obj.h"

namespace S2S {

// Remote result codes the client gives a meaning to; every other code is passed on unchanged.
enum RsyncResult : int {
    kRsyncResultOK = 0,
    kRsyncResultNoAddress = 42,      // TestServer: the server's addresses could not be looked up
    kRsyncResultUnknownCmd = 43,     // old server: the command is unknown
    kRsyncResultNoVersion = 44,      // Connect: the server answered, its version query failed
    kRsyncResultUnknownCmdAlt = 51,  // old server, second form of the same answer
    kRsyncResultRetryPlain = 202,    // S2S_SyncStart: attribute keys refused, send without them
    kRsyncResultDryRunOK = 207,      // dry-run pairing answer that still proves a connection
    kRsyncResultNotTested = 213,     // TestServer: no address was tested
    kRsyncResultConflict = 214,      // multi-source pairing: some shares belong to another client
    kRsyncResultLocalFailure = 300,  // SyncEncryptKey: failed before the transfer
};

class S2S_EXPORT Rsyncer {
  public:
    // One configured rsync run against the sync server: built on the stack, configured, run once.
    // The options every run wants (delete extraneous files, numeric ids, authentication, pseudo
    // root) are set by the constructor.
    class S2S_EXPORT RsyncTask : public VURN::Backup::RsyncWrapper {
      public:
        RsyncTask();
        ~RsyncTask() override;

        void SetServerIP(const std::string& ip) { serverIP = ip; }
        void SetUser(const std::string& name) { user = name; }
        void SetPassword(const std::string& pass) { password = pass; }
        void SetSSH(bool on) { setSsh(on); }
        void SetServerPort(unsigned port) { setPort(static_cast<int>(port)); }
        void SetCompression(bool on) { setCompress(on); }
        // Block-level sync is rsync's delta transfer.
        void SetBlockLevelSync(bool on) { setDeltaCopy(on); }
        void SetListOnly(bool on) { setListOnly(on); }
        void SetRelativePath(bool on) { setRelativePath(on); }
        void SetSyncACL(bool on) { setVurnAcl(on); }
        // A test (dry-run) task runs without the wrapper's debug log, every real task with it.
        void SetTestTask(bool on) { setDebugLog(!on); }
        // At most `count` deletions on the server in a transfer; negative: no limit.
        void SetMaxDelete(long long count) { setMaxDelete(count); }

        // Transfers local `src` to `dst` (under `module`) on the server; 600 s stall limit.
        // 0, or the rsync / server result code.
        int Execute(const std::string& src, const std::string& dst, bool (*cancel)(),
                    const std::string& module, const std::list<std::string>& excludes);
        // Runs a remote command: the lines reach the server's command handler; 60 s limit.
        int ExecuteCmd(const std::list<std::string>& cmdLines, bool (*cancel)());

      private:
        std::string serverIP;
        std::string user;
        std::string password;  // held in memory only, never logged
    };

    Rsyncer();
    ~Rsyncer();
    Rsyncer(const Rsyncer&) = delete;
    Rsyncer& operator=(const Rsyncer&) = delete;

    // Copies `info` and looks for a reachable server address and its protocol version:
    // TestServer's result (0 when found). Kept as it always was: when the connection test passed
    // but the version query then failed, this is still 0 and the version stays -1, which reads as
    // a server without multi-source pairing; use Connect.
    int Initialize(const SyncInfo& info);
    // What our programs call instead of Initialize: the same, except that a failed version query
    // is a failure. 0 only when the server's protocol version is known (an old server's 0
    // included); TestServer's code when no address answered; kRsyncResultNoVersion when an address
    // answered but the version could not be read (GetServerVersionResult says how it failed,
    // GetLastError why). Pairing must not go on then: an unknown version would be taken for an
    // old server and skip the multi-source conflict check.
    int Connect(const SyncInfo& info);
    // Takes the address and protocol version an earlier Connect of the same task settled on
    // instead of testing the server again (what a task that runs every few seconds does between
    // runs): `info` with `address` as its server IP. Nothing is sent; a server that stopped
    // answering shows in the next command's result.
    void Adopt(const SyncInfo& info, const std::string& address, int version);
    // Keeps everything: the share cache and the server version survive re-initialisation.
    void Clear();
    void SetCancelChecker(bool (*fn)()) { cancelChecker = fn; }
    // Receives the overall progress (0 to 100) of RunSync's transfers, on the caller's thread
    // while the run goes on; for progress displays. Commands and key transfers report none.
    void SetProgressCallback(const boost::function<void(int)>& fn) { progressCallback = fn; }
    // The deletion limit of the next RunSync's transfer (rsync's own --max-delete; the run ends
    // with 25 when it is reached); negative, the default: no limit. RunSync uses it up: the run
    // after it has no limit unless one is set again.
    void SetMaxDelete(long long count) { maxDelete = count; }
    // A copy, with the server address TestServer settled on.
    SyncInfo GetSyncInfo() const { return syncInfo; }

    // Share facts, read from the host once per Rsyncer and cached by name.
    int GetShareInfo(const std::string& name, ShareInfo& info);

    // Fills a task with the server, credentials and SSH use of the SyncInfo (and the SSH port
    // when SSH is on).
    int InitRsyncTask(RsyncTask& task, bool isTest) const;

    // --- command files (0, or -1 with one ERROR line) ------------------------------------------
    // These two are not const, as they have always been declared (programs link against them);
    // the const DoSinglePairing builds its lines through SinglePairLines.
    int GenServerVersionCmd(const std::string& outfile, std::list<std::string>& lines);
    int GenSinglePairCmd(bool dryRun, std::list<std::string>& lines);
    int GenPairMultiSrcCmd(bool dryRun, const std::list<std::string>& shares,
                           const std::string& outfile, std::list<std::string>& lines) const;
    int GenFinishSyncCmd(const std::string& finishType, const std::string& name,
                         std::list<std::string>& lines) const;
    int GenSendBeaconCmd(const std::string& taskName, std::list<std::string>& lines) const;
    int GenStartSyncShareCmd(const std::string& shareName, bool withAttributes,
                             std::list<std::string>& lines);

    // --- remote commands: 0 when the command was sent (its code in `result`), -1 when not ------
    void GetServerVersion();
    int GetServerVersionValue() const { return serverVersion; }
    // How the last version query ended: 0 when it read a version (an old server's too); else
    // the run's code, or the wrapper's 11 (no temporary output file here), 12 (no number in the
    // reply) or 1 (no command could be built) for a failure of its own.
    int GetServerVersionResult() const { return versionResult; }
    // Why the last run or step failed, in words, for people: the error lines rsync printed in
    // that run (at most 8, never the password; rsync's own text such as "No space left on
    // device"), or the local cause when it failed before rsync ran (the temporary directory,
    // for instance). "" when there is nothing to say.
    std::string GetLastError() const { return lastError; }
    bool SupportMultiSource() const { return serverVersion > 0; }
    int DoSinglePairing(bool dryRun, int& result) const;
    int DoMultiPairing(bool dryRun, const std::list<std::string>& shares,
                       std::list<std::string>& conflictShares, int& result) const;
    int DoPairing(bool dryRun, const std::list<std::string>& shares,
                  std::list<std::string>& conflictShares, int& result) const;
    int TestProtocol(int& result) const;
    // 0 when an address answered both a dry-run pairing and the version query; otherwise a
    // result code (42 no address, else the last code seen).
    int TestServer();
    int FinishSync(const std::string& finishType, const std::string& name, int& result) const;
    int SendBeacon(const std::string& taskName, int& result) const;

    // --- share sync ------------------------------------------------------------------------------
    int StartSyncShare(const std::string& shareName, bool withAttributes, int& result);
    // Announces the share with its attributes, and again without them when the server asks (202).
    int StartSyncShare(const std::string& shareName, int& result);
    // Pushes the whole share (relPath "/") or one path inside it (relPath starting with "/"),
    // at most at the task's bandwidth limit (SyncInfo::GetMaxBandwidth, KiB per second; 0 none).
    int RunSync(unsigned long long id, const std::string& shareName, const std::string& relPath,
                const std::list<std::string>& excludes, int& result);
    // Pushes only `paths` of the share (relative to its folder, no leading "/"): a folder with
    // everything below it; a path gone from the share is deleted on the server, and the deletion
    // limit (SetMaxDelete) counts those deletions too. The same options and limits as RunSync
    // otherwise. 0 (the run's code in `result`), or -1 when the share's facts cannot be read or
    // the list of paths cannot be written (GetLastError says why).
    int RunSyncPaths(const std::string& shareName, const std::vector<std::string>& paths,
                     const std::list<std::string>& excludes, int& result);

    // Sends an encrypted share's key file into the server's key directory, always over SSH on the
    // task's SSH port. 0 when there was nothing to send, the transfer's code, or 300 for a local
    // failure before the transfer.
    int SyncEncryptKey(const std::string& shareName) const;

  private:
    typedef std::list<std::pair<std::string, std::string> > ParamList;
    // command="name", clientID="...", then key="value" per parameter, appended to `lines`.
    static int GenCommandLines(const std::string& command, const ParamList& params,
                               std::list<std::string>& lines);
    // The lines of GenSinglePairCmd.
    static int SinglePairLines(bool dryRun, std::list<std::string>& lines);
    // A data run of the share from `src`, limited to the paths listed in `listFile` when it is
    // not empty.
    int Transfer(const std::string& shareName, const std::string& src, bool relative,
                 const std::string& listFile, const std::list<std::string>& excludes, int& result);
    // Runs command lines as one fresh command task of this server; the run's code in `result`.
    void RunCommandLines(const std::list<std::string>& lines, bool isTest, int& result) const;

    int serverVersion;  // -1 unknown, 0 old server without multi-source support, >0 version
    int versionResult;  // how the last version query ended (GetServerVersionResult)
    mutable std::string lastError;  // GetLastError; const operations run rsync too
    bool (*cancelChecker)();
    SyncInfo syncInfo;
    std::map<std::string, ShareInfo> shareInfoCache;
    std::string reserved;  // no operation reads or writes it yet
    boost::function<void(int)> progressCallback;
    long long maxDelete = -1;
};

// Splits `text` at every character of `separators`, appending each piece (empty ones included)
// to `out`; an empty text gives one empty piece.
S2S_EXPORT void SplitStringByChars(const std::string& text, const std::string& separators,
                                   std::list<std::string>& out);
// The items with `separator` between neighbours; an empty list gives "".
S2S_EXPORT std::string JoinItems(const std::list<std::string>& items, const std::string& separator);

}  // namespace S2S

#endif  // S2S_RSYNCER_H
