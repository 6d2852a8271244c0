// The wrapper's settings and the pieces of a run shared by its transfer and command paths.
#ifndef S2S_RSYNC_RSYNC_WRAPPER_IMPL_H
#define S2S_RSYNC_RSYNC_WRAPPER_IMPL_H

#include <boost/function.hpp>
#include <list>
#include <map>
#include <string>
#include <vector>

#include "rsync/child_process.h"
#include "s2s_logger.h"
#include "s2s_rsync_wrapper.h"

namespace VURN {
namespace Backup {

// The names the wrapper's sources (transfer, commands, SSH login check) all use.
using S2S::Logger;
using S2S::rsync_internal::ChildCommand;
using S2S::rsync_internal::ChildOutcome;

struct RsyncWrapper::Impl {
    std::string src;
    std::string server;
    std::string user;
    std::string password;  // only ever placed in the child's environment
    std::string dest;
    std::string module;
    bool ssh = false;
    int port = 0;  // 0: rsync's default port (873) or ssh's (22)
    bool compress = false;
    bool delta = true;
    bool listOnly = false;
    bool relative = false;
    bool numericIds = false;
    bool deleteExtraneous = false;
    int timeout = 0;
    unsigned bwlimit = 0;  // KiB per second, 0 unlimited
    int connectTimeout = 30;
    bool debugLog = false;
    std::list<std::string> excludes;
    bool acl = false;
    bool auth = false;
    bool authStrict = false;
    bool pseudoRoot = false;
    std::list<std::string> cmdLines;

    std::string rsyncPath = "rsync";
    std::string commandModule = "@s2s-cmd";
    std::map<std::string, std::string> pathModules;
    std::string logFile;
    std::string remoteConfig;
    std::string knownHosts;
    std::string identity;
    boost::function<void(int)> progress;
    long long maxDelete = -1;
    boost::function<void(const std::string&, const std::string&)> dryRunItems;
    std::string filesFrom;

    std::string lastError;

    Impl();

    // "" when the connection settings are usable, else why not.
    std::string CheckConnection() const;
    // The rsync:// URL of `target` (a module, or module/path) on the server.
    std::string Url(const std::string& target) const;
    // The daemon target of setDestPath's dest/module; "" with `*why` set when there is none.
    std::string TransferTarget(std::string* why) const;
    // Options shared by every run: time-outs, the remote shell for ssh.
    void ConnectionOptions(std::vector<std::string>* argv) const;
    // Over ssh: the ssh command line (sshpass first when a password logs in), blank-separated;
    // every piece was checked to hold no blank or quote, so rsync's -e splitting keeps it intact.
    std::string RemoteShell() const;
    // Over ssh: the receiver's daemon configuration the one-shot daemon reads.
    std::string RemoteConfigPath() const;
    // Over ssh, before the first run to a destination (and again once a successful check is ten
    // minutes old): asks the server, through the same login, whether that login can read the
    // daemon configuration. 0 when it can, or when the question itself could not be answered
    // (rsync then reports what it meets); kResultSshLogin when it cannot; 5 when ssh refused the
    // password; 30 when the server did not answer in time; 20 when cancelled.
    int CheckSshLogin(const boost::function<bool()>& cancel);
    // The message of kResultSshLogin; `why` says what was found.
    std::string SshLoginMessage(const std::string& why) const;
    // Drops the remembered check of this destination (its daemon failed to start after all).
    void ForgetSshLogin() const;
    // What a remembered check is filed under: login, server, port, configuration, identity.
    std::string SshLoginKey() const;
    // The password and the remote shell's password in the child's environment only.
    void Environment(ChildCommand* job) const;
    // Runs rsync; keeps the last error lines; maps spawn failures and cancellation.
    int Run(ChildCommand& job, const boost::function<bool()>& cancel, bool commandRun);
    // A run refused before it started (settings that cannot make a safe command line): `why`
    // becomes the last error and an ERROR line; kResultUsage.
    int RefuseRun(const std::string& why);

    int ExecuteTransfer(const boost::function<bool()>& cancel);
    int ExecuteCommand(const boost::function<bool()>& cancel);
};

}  // namespace Backup
}  // namespace VURN

#endif  // S2S_RSYNC_RSYNC_WRAPPER_IMPL_H
