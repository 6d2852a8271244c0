// The check made before rsync runs over ssh: the one-shot daemon started through ssh runs as the
// SSH login and must read the receiver's root-only daemon configuration, so a login that cannot
// is refused with a message that names it and says what to do, instead of rsync's bare
// "syntax or usage error". A successful check is remembered per destination for ten minutes, so
// that the runs of one sync cost one extra login, not one each.
#include <chrono>
#include <map>
#include <mutex>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

#include "rsync/rsync_wrapper_impl.h"
#include "s2s_logger.h"

namespace VURN {
namespace Backup {

namespace {

using Clock = std::chrono::steady_clock;

constexpr const char kReadable[] = "s2s-config-readable";
constexpr const char kUnreadable[] = "s2s-config-unreadable";
constexpr std::chrono::minutes kCheckedFor(10);
constexpr int kSshpassWrongPassword = 5;  // sshpass: ssh asked for the password again
constexpr int kRsyncTimeout = 30;

std::mutex g_checkedMutex;
std::map<std::string, Clock::time_point> g_checked;  // destination -> when its check passed

bool RecentlyChecked(const std::string& key) {
    std::lock_guard<std::mutex> lock(g_checkedMutex);
    auto it = g_checked.find(key);
    return it != g_checked.end() && Clock::now() - it->second < kCheckedFor;
}

void Remember(const std::string& key, bool passed) {
    std::lock_guard<std::mutex> lock(g_checkedMutex);
    if (passed) {
        g_checked[key] = Clock::now();
    } else {
        g_checked.erase(key);
    }
}

}  // namespace

std::string RsyncWrapper::Impl::SshLoginMessage(const std::string& why) const {
    return "the SSH login '" + user + "' on " + server + " " + why + " " + RemoteConfigPath() +
           ": the daemon that rsync starts over SSH runs as that login and needs root's "
           "configuration, so over SSH the user must be root (uid 0) on the receiving server, "
           "which must have run s2s-receiver configure (see docs/security.md)";
}

int RsyncWrapper::Impl::CheckSshLogin(const boost::function<bool()>& cancel) {
    const std::string key = SshLoginKey();
    if (RecentlyChecked(key)) {
        return 0;
    }
    ChildCommand job;
    std::istringstream pieces(RemoteShell());
    for (std::string piece; pieces >> piece;) {
        job.argv.push_back(piece);
    }
    // The path holds only [A-Za-z0-9._/-] (CheckConnection): nothing the remote shell expands.
    job.argv.insert(job.argv.end(), {"--", server,
                                     "test -r " + RemoteConfigPath() + " && echo " + kReadable +
                                         " || echo " + kUnreadable});
    job.unset_env = {"RSYNC_PASSWORD", "SSHPASS"};
    if (auth && !password.empty() && identity.empty()) {
        job.set_env.push_back(std::make_pair("SSHPASS", password));
    }
    const Clock::time_point deadline =
        Clock::now() + std::chrono::seconds((connectTimeout > 0 ? connectTimeout : 30) + 30);
    bool late = false;
    const boost::function<bool()> stop = [&]() {
        late = Clock::now() > deadline;
        return late || (cancel && cancel());
    };
    std::vector<std::string> lines;
    bool readable = false;
    bool unreadable = false;
    const ChildOutcome outcome =
        S2S::rsync_internal::RunChild(job, stop, [&](const std::string& l) {
            readable = readable || l == kReadable;
            unreadable = unreadable || l == kUnreadable;
            if (!l.empty() && l != kReadable && l != kUnreadable && lines.size() < 8) {
                lines.push_back(l);
            }
        });
    std::string said;
    for (const auto& l : lines) {
        said += l + "\n";
    }
    if (!outcome.started) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] ssh_login_check.cpp(%d): Fail to start ssh for the login "
                       "check: %s\n",
                       __LINE__, outcome.error.c_str());
        return 0;  // rsync starts the same programs and reports it
    }
    if (outcome.cancelled) {
        if (!late) {
            return kResultCancelled;
        }
        lastError = "ssh: the server did not answer the SSH login check in time\n" + said;
        return kRsyncTimeout;
    }
    if (outcome.exit_code == 0 && readable) {
        Remember(key, true);
        return 0;
    }
    if (outcome.exit_code == 0 && unreadable) {
        lastError = SshLoginMessage("cannot read the receiving server's daemon configuration");
        Logger::LogMsg(Logger::Error, "[ERROR] ssh_login_check.cpp(%d): %s\n", __LINE__,
                       lastError.c_str());
        return kResultSshLogin;
    }
    if (outcome.exit_code == kSshpassWrongPassword && !password.empty() && identity.empty()) {
        lastError = "ssh: the server refused the SSH login '" + user + "' or its password\n" + said;
        return kSshpassWrongPassword;
    }
    // Anything else (no connection, a login shell that runs no commands): rsync meets the same
    // and says so in its own words.
    Logger::LogMsg(Logger::Warning,
                   "[WARNING] ssh_login_check.cpp(%d): the SSH login check gave no answer [%d]\n",
                   __LINE__, outcome.exit_code);
    return 0;
}

void RsyncWrapper::Impl::ForgetSshLogin() const {
    Remember(SshLoginKey(), false);
}

std::string RsyncWrapper::Impl::SshLoginKey() const {
    return user + "@" + server + ":" + std::to_string(port) + " " + RemoteConfigPath() + " " +
           identity;
}

}  // namespace Backup
}  // namespace VURN
