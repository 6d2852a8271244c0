// VURN::Backup::RsyncWrapper: one rsync run over the stock rsync binary. The sync driver's
// RsyncTask derives from it; the wrapper owns the command line, the authentication with the
// server and the delivery of custom command lines to the server's command handler.
//
// How the settings reach the server (rsync daemon transport, the default):
//   setDestPath(server, user, password, dest, module) names the target
//     rsync://user@server:port/<target>
//   where <target> is
//     - module empty:            dest itself; its first component is the daemon module, so
//                                "photos" and "photos/sub" land in the module "photos", and an
//                                encrypted share's "@photos@" in the module "@photos@";
//     - module set, dest relative: module + "/" + dest;
//     - module set, dest absolute: the daemon module that serves that server directory (see
//                                setServerPathModule; "/usr/vurn/etc/.encrypt" is served by the
//                                key module "@s2s-key") + "/" + module + "/", so an encryption
//                                key lands in a directory named after its share.
//   The port is setPort's (default 873). With setSsh(true) the same modules are reached through
//   rsync's daemon-over-remote-shell mode: ssh to server:port as `user`, where rsync starts a
//   one-shot daemon with the receiver's configuration (setRemoteConfig).
//   The password travels only in the child's environment (RSYNC_PASSWORD, and SSHPASS for ssh).
//
// Custom commands (setVurnCustCmdRule with a non-empty list, dest and module empty): the lines
// are sent as rsync's early input to the command module ("@s2s-cmd", setCommandModule) under a
// random reply token; the server's handler runs the command and leaves its result code and output
// in a reply directory named by the token, which the same run pulls back. execute() returns the
// handler's result code; when the lines carry outfile="<local path>", the reply's output file
// (at most 1 MiB) is written to that local path. The command file (with the token line) may
// hold at most 4096 bytes.
// The server's answers are described in docs/protocol.md.
//
// Result codes of execute(): 0; rsync's own exit code (5 authentication refused or unknown
// module, 10 server unreachable, 30/35 time-outs, 23 partial transfer, ...); the server's result
// code for a command; 51 when the server has no command module (a server that knows no custom
// commands); 20 when the run was cancelled through the predicate; 1 when the settings are
// incomplete or malformed (also: a user name and password rsync cannot authenticate, see
// credentialsFit); 11 when a local file (temporary directory, command file, output file, which is
// never written through a symbolic link) could not be handled; 12 when a command's reply is
// malformed; 14 when rsync could not be started; 53 when a hook of the server's daemon could not
// start (rsync's "@ERROR: early exec failed", or a pre-transfer hook that the shell could not
// find or execute): rsync itself says 5 or 4 then, which would read as a refused password or
// action.
//
// Over ssh, before the first run to a destination (again once ten minutes have passed), one short
// ssh command through the same login (the password again only in SSHPASS) asks whether that
// login can read the daemon configuration; when it cannot, execute() returns 52 without running
// rsync, and lastError() names the login and what to do. A one-shot daemon that fails to start
// anyway (rsync's "syntax or usage error" before any greeting) gives the same 52. A refused
// password in that check gives 5, a server that does not answer it in time 30.
//
// Pointing a wrapper at a test daemon started by s2s-receiver on 127.0.0.1:<port>:
//   w.setPort(port); w.setDestPath("127.0.0.1", user, password, "<share>", "");
// with the user and password given to `s2s-receiver configure`; commands need nothing more.
#ifndef S2S_RSYNC_WRAPPER_H
#define S2S_RSYNC_WRAPPER_H

#include <boost/function.hpp>
#include <cstddef>
#include <list>
#include <memory>
#include <string>

#include "s2s_export.h"

namespace VURN {
namespace Backup {

class S2S_EXPORT RsyncWrapper {
  public:
    // Result codes the wrapper produces itself (the others are rsync's or the server's).
    enum Result : int {
        kResultUsage = 1,        // settings incomplete or malformed
        kResultLocalFile = 11,   // a local temporary or output file could not be handled
        kResultBadReply = 12,    // a command's reply was malformed
        kResultSpawn = 14,       // rsync could not be started
        kResultCancelled = 20,   // the cancel predicate returned true
        kResultNoCommands = 51,  // the server has no command module
        // Over ssh: the login cannot read the receiver's daemon configuration, so the one-shot
        // daemon it would start cannot serve (the login must be root there).
        kResultSshLogin = 52,
        // A hook of the receiving server's daemon (the command module's early hook, a module's
        // pre-transfer hook) could not start or failed; the receiver's daemon log says why.
        kResultHookFailed = 53,
    };

    // rsync's daemon reads its secrets file in lines of at most 1023 bytes ("user:password"
    // without the line end): a longer pair can never authenticate, over the daemon port or SSH.
    static constexpr size_t kMaxSecretLine = 1023;
    // False when `user` and `password` cannot authenticate for that reason (with a one-letter user
    // name: a password of 1022 bytes or more). execute() refuses such settings with 1; programs
    // that take a password refuse it at once with this test.
    static bool credentialsFit(const std::string& user, const std::string& password);

    RsyncWrapper();
    virtual ~RsyncWrapper();
    RsyncWrapper(const RsyncWrapper&) = delete;
    RsyncWrapper& operator=(const RsyncWrapper&) = delete;

    void setSrcPath(std::string path);
    void setDestPath(std::string server, std::string user, std::string password, std::string dest,
                     std::string module);
    void setSsh(bool on);
    void setPort(int port);
    void setCompress(bool on);
    void setDeltaCopy(bool on);
    void setListOnly(bool on);
    void setRelativePath(bool on);
    void setNumericIds(bool on);
    void setDelete(bool on);
    void setTimeout(int seconds);
    void setDebugLog(bool on);
    void setExcludeRule(std::list<std::string> rules);
    void setVurnAcl(bool on);
    void setVurnAuth(bool on, bool strict);
    void setVurnPseudoRoot(bool on);
    void setVurnCustCmdRule(std::list<std::string> lines);

    // --- extras: defaults suit a production server; tests and tools override them -------------
    // The rsync program (default: "rsync" looked up in PATH).
    void setRsyncPath(std::string path);
    // Seconds allowed to reach the server (rsync --contimeout, ssh ConnectTimeout); default 30.
    void setConnectTimeout(int seconds);
    // The daemon module that runs custom commands (default "@s2s-cmd").
    void setCommandModule(std::string module);
    // Maps an absolute server directory used as a destination to the daemon module serving it.
    void setServerPathModule(std::string serverPath, std::string module);
    // Where the debug log goes when setDebugLog(true) (default "/var/log/s2s_rsync.log" below
    // $S2S_ROOT). Before a run that writes it, a log of kLogRotateBytes or more is rotated: it
    // becomes "<log>.1", the older ones move up to "<log>.<kLogKeep>", and the oldest is dropped.
    void setLogFile(std::string path);
    static constexpr long long kLogRotateBytes = 8LL << 20;
    static constexpr int kLogKeep = 3;
    // Data runs: rsync's --bwlimit, in KiB (1024 bytes) per second; 0 (the default) is unlimited.
    void setBandwidthLimit(unsigned kibPerSecond);
    // Over ssh: the server's daemon configuration that the one-shot daemon reads (default
    // "/usr/vurn/etc/s2s_rsyncd.conf" on the server). The local $S2S_ROOT says nothing about
    // the server's paths and is not applied; $S2S_REMOTE_ROOT, when set, stands for the server's
    // root (both servers on one machine: tests, the demo). Only [A-Za-z0-9._/-] characters are
    // accepted.
    void setRemoteConfig(std::string path);
    // Over ssh: the known-hosts file to check and record the server's key in (default: ssh's
    // own). Unknown hosts are accepted and recorded on first contact.
    void setSshKnownHostsFile(std::string path);
    // Over ssh: an identity file for key authentication (then no password is needed).
    void setSshIdentityFile(std::string path);
    // Called from execute()'s thread with the overall progress of a transfer, 0 to 100.
    void setProgressCallback(boost::function<void(int)> callback);
    // A transfer deletes at most `count` extraneous files on the server (rsync --max-delete;
    // 0 deletes none); beyond it rsync stops deleting and the run ends with 25. Negative: no
    // limit (the default).
    void setMaxDelete(long long count);
    // Makes the next transfer a dry run: nothing changes on either side, and every entry the run
    // would look at, unchanged ones and deletions included, is reported to `callback` from
    // execute()'s thread with rsync's change summary ("*deleting", ">f+++++++++" for a new file,
    // ".d..t......") and its path as rsync prints it. An empty callback makes it a real run again.
    void setDryRun(
        boost::function<void(const std::string& change, const std::string& path)> callback);
    // Limits a transfer to the paths listed in `listFile` (relative to the source path, separated
    // by NUL bytes): a listed folder is sent with everything below it, and a listed path that no
    // longer exists on this side is deleted on the server (rsync --files-from, --from0,
    // --delete-missing-args); the deletion limit counts those deletions too. The source path
    // must then be the folder the paths are relative to. "" (the default) sends the whole source.
    void setFilesFrom(std::string listFile);

    // Runs rsync with these settings; polls `cancel` (when set) at least every 200 ms and stops
    // the run when it returns true. 0, or rsync's / the server's numeric result code.
    int execute(boost::function<bool()> cancel);

    // The last error lines rsync (or the wrapper) reported for the previous execute(); never
    // holds the password.
    std::string lastError() const;

  private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace Backup
}  // namespace VURN

#endif  // S2S_RSYNC_WRAPPER_H
