// The rsync wrapper's settings and its data runs: the command line of a transfer, the connection
// options shared with command runs, the child's environment, and the run itself.
#include <dirent.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <utility>
#include <vector>

#include "core/protocol.h"
#include "rsync/rsync_wrapper_impl.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

namespace VURN {
namespace Backup {

namespace {

// Where the debug log of client runs goes, and the receiver's daemon configuration that a
// one-shot daemon started over ssh reads (both below $S2S_ROOT when it is set).
constexpr const char* kDefaultLogFile = "/var/log/s2s_rsync.log";
constexpr const char* kDefaultRemoteConfig = "/usr/vurn/etc/s2s_rsyncd.conf";
constexpr const char* kKeyModule = "@s2s-key";
constexpr size_t kKeptErrorLines = 8;
constexpr int kRsyncVanished = 24;     // rsync: some source files vanished during the run
constexpr int kRsyncDeleteLimit = 25;  // rsync: the --max-delete limit stopped deletions
// What rsync prints when --max-delete stopped deletions; a push to a daemon still ends with 0.
constexpr const char kDeletionsStopped[] = "Deletions stopped due to --max-delete limit";
// Marks the lines of a dry run's entries in rsync's merged output, apart from its messages.
constexpr const char kItemPrefix[] = "s2s-item:";
// What rsync says when the daemon's early hook failed, when a pre-transfer hook ended, and when
// it could not even prepare one; a shell that cannot find or execute the hook program ends with
// 127 or 126, which rsync shows as the raw wait status.
constexpr const char kEarlyExecFailed[] = "@ERROR: early exec failed";
constexpr const char kPreXferFailed[] = "pre-xfer exec returned failure (";
constexpr const char kExecPreparation[] = "exec preparation failed";
// What a client sees when the one-shot daemon started over ssh stopped before its greeting.
constexpr const char kUsageError[] = "syntax or usage error";
constexpr const char kNoGreeting[] = "did not see server greeting";

// Host names and numeric addresses (IPv6 with an optional zone): nothing that could turn the
// URL into another user, path or option.
bool ValidServer(const std::string& s) {
    if (s.empty() || s[0] == '-') {
        return false;
    }
    for (unsigned char c : s) {
        if (!(std::isalnum(c) || c == '.' || c == '-' || c == ':' || c == '_' || c == '%')) {
            return false;
        }
    }
    return true;
}

bool ValidUser(const std::string& s) {
    if (s.empty() || s[0] == '-' || S2S::protocol::HasControl(s)) {
        return false;
    }
    return s.find_first_of("@:/ \t'\"\\") == std::string::npos;
}

// Paths handed to ssh's command line through rsync's -e parsing (which splits at blanks and
// honours quotes): only plain characters are let through.
bool PlainPath(const std::string& s) {
    if (s.empty()) {
        return false;
    }
    for (unsigned char c : s) {
        if (!(std::isalnum(c) || c == '.' || c == '_' || c == '/' || c == '-')) {
            return false;
        }
    }
    return true;
}

std::string StripSlashes(const std::string& s) {
    size_t b = s.find_first_not_of('/');
    if (b == std::string::npos) {
        return std::string();
    }
    return s.substr(b);
}

bool HasDotDot(const std::string& path) {
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string::npos) {
            end = path.size();
        }
        if (path.compare(start, end - start, "..") == 0 && end - start == 2) {
            return true;
        }
        start = end + 1;
    }
    return false;
}

// The overall percentage of an --info=progress2 line ("  1,234  45%  1.2MB/s  0:00:01 ..."),
// or -1 when the line is none.
int ProgressPercent(const std::string& line) {
    size_t pct = line.find('%');
    if (pct == std::string::npos || pct == 0) {
        return -1;
    }
    size_t start = pct;
    while (start > 0 && std::isdigit(static_cast<unsigned char>(line[start - 1]))) {
        --start;
    }
    if (start == pct || pct - start > 3 || (start > 0 && line[start - 1] != ' ')) {
        return -1;
    }
    int value = std::stoi(line.substr(start, pct - start));
    return value <= 100 ? value : -1;
}

// The remote configuration is a path on the server: the local S2S_ROOT does not apply to it.
std::string DefaultRemoteConfig() {
    const char* root = std::getenv("S2S_REMOTE_ROOT");
    std::string base = root != nullptr ? root : "";
    while (!base.empty() && base.back() == '/') {
        base.pop_back();
    }
    return base + kDefaultRemoteConfig;
}

// Moves a full log aside before rsync appends to it: <log> becomes <log>.1, <log>.1 <log>.2, and
// so on up to <log>.<keep>; the oldest is dropped. Runs of several processes may meet here: the
// log's own flock lets one of them rotate, and the others see the fresh file afterwards.
void RotateLog(const std::string& log, long long limit, int keep) {
    int fd = open(log.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) {
        return;  // no log yet: rsync creates it
    }
    struct stat held;
    struct stat now;
    if (flock(fd, LOCK_EX) == 0 && fstat(fd, &held) == 0 && held.st_size >= limit &&
        stat(log.c_str(), &now) == 0 && now.st_ino == held.st_ino && now.st_dev == held.st_dev) {
        for (int i = keep - 1; i >= 1; --i) {
            rename((log + "." + std::to_string(i)).c_str(),
                   (log + "." + std::to_string(i + 1)).c_str());
        }
        if (rename(log.c_str(), (log + ".1").c_str()) != 0) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] rsync_wrapper.cpp(%d): Fail to rotate log '%s': %s\n",
                           __LINE__, log.c_str(), strerror(errno));
        }
    }
    close(fd);
}

void MakeParentDir(const std::string& path) {
    size_t slash = path.rfind('/');
    if (slash == std::string::npos || slash == 0) {
        return;
    }
    std::string dir = path.substr(0, slash);
    for (size_t pos = 1; pos <= dir.size(); ++pos) {
        if (pos == dir.size() || dir[pos] == '/') {
            mkdir(dir.substr(0, pos).c_str(), 0755);
        }
    }
}

// rsync's --sparse makes the receiver look for runs of zeros in everything it writes, which costs
// half its CPU time again or more on data without holes; it is asked for only when the source holds
// a file with holes. A regular file whose allocated blocks cover less than its size is a candidate
// (compressed or inline data look like that too), and SEEK_HOLE then tells.
bool HasHole(int dirFd, const char* name, const struct stat& st) {
    if (!S_ISREG(st.st_mode) || st.st_size == 0 ||
        static_cast<off_t>(st.st_blocks) * 512 >= st.st_size) {
        return false;
    }
    int fd = openat(dirFd, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
    if (fd < 0) {
        return true;  // cannot tell: keep whatever holes there are
    }
    off_t hole = lseek(fd, 0, SEEK_HOLE);
    close(fd);
    return hole < 0 || hole < st.st_size;
}

// True when the tree at `src` (a file or a directory, not following symbolic links below it)
// holds a file with holes.
bool HoldsSparseFile(const std::string& src) {
    struct stat st;
    if (stat(src.c_str(), &st) != 0) {
        return false;  // rsync reports what it cannot read
    }
    if (!S_ISDIR(st.st_mode)) {
        return HasHole(AT_FDCWD, src.c_str(), st);
    }
    std::vector<std::string> dirs = {src};
    while (!dirs.empty()) {
        std::string dir = dirs.back();
        dirs.pop_back();
        DIR* d = opendir(dir.c_str());
        if (d == nullptr) {
            continue;
        }
        bool found = false;
        while (struct dirent* e = readdir(d)) {
            if (e->d_type != DT_REG && e->d_type != DT_DIR && e->d_type != DT_UNKNOWN) {
                continue;
            }
            if (std::strcmp(e->d_name, ".") == 0 || std::strcmp(e->d_name, "..") == 0 ||
                fstatat(dirfd(d), e->d_name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
                continue;
            }
            if (S_ISDIR(st.st_mode)) {
                dirs.push_back(dir + "/" + e->d_name);
            } else if (HasHole(dirfd(d), e->d_name, st)) {
                found = true;
                break;
            }
        }
        closedir(d);
        if (found) {
            return true;
        }
    }
    return false;
}

// HoldsSparseFile over the paths a --files-from list (NUL-separated, relative to `src`) names.
bool ListHoldsSparseFile(const std::string& src, const std::string& listFile) {
    std::ifstream list(listFile, std::ios::binary);
    std::string path;
    while (std::getline(list, path, '\0')) {
        if (!path.empty() && HoldsSparseFile(src + "/" + path)) {
            return true;
        }
    }
    return false;
}

}  // namespace

RsyncWrapper::Impl::Impl() {
    pathModules[S2S_PATH_KEY_DIR] = kKeyModule;
}

std::string RsyncWrapper::Impl::CheckConnection() const {
    if (!ValidServer(server)) {
        return "invalid server address";
    }
    if (auth) {
        if (!ValidUser(user)) {
            return "invalid user name";
        }
        if (authStrict && password.empty() && !(ssh && !identity.empty())) {
            return "authentication requires a password";
        }
        if (!credentialsFit(user, password)) {
            return "the user name and password together are longer than rsync accepts (" +
                   std::to_string(kMaxSecretLine) + " bytes with the ':' between them)";
        }
    }
    if (port < 0 || port > 65535 || timeout < 0 || connectTimeout < 0) {
        return "invalid port or time-out";
    }
    if (ssh) {
        if (!remoteConfig.empty() && !PlainPath(remoteConfig)) {
            return "remote configuration path holds characters that are not allowed";
        }
        if ((!knownHosts.empty() && !PlainPath(knownHosts)) ||
            (!identity.empty() && !PlainPath(identity))) {
            return "ssh file path holds characters that are not allowed";
        }
    }
    return std::string();
}

std::string RsyncWrapper::Impl::Url(const std::string& target) const {
    std::string host = server.find(':') != std::string::npos ? "[" + server + "]" : server;
    std::string url = "rsync://";
    if (auth) {
        url += user + "@";
    }
    url += host;
    // Over ssh the port belongs to ssh (-e); the one-shot daemon needs none.
    if (!ssh && port > 0) {
        url += ":" + std::to_string(port);
    }
    return url + "/" + target;
}

std::string RsyncWrapper::Impl::TransferTarget(std::string* why) const {
    if (S2S::protocol::HasControl(dest) || S2S::protocol::HasControl(module) || HasDotDot(dest) ||
        HasDotDot(module)) {
        *why = "destination holds control characters or '..'";
        return std::string();
    }
    if (module.empty()) {
        std::string target = StripSlashes(dest);
        if (target.empty()) {
            *why = "no destination module";
        }
        return target;
    }
    if (module.find('/') != std::string::npos) {
        *why = "module name holds '/'";
        return std::string();
    }
    if (!dest.empty() && dest[0] == '/') {
        std::string dir = dest;
        while (dir.size() > 1 && dir.back() == '/') {
            dir.pop_back();
        }
        auto it = pathModules.find(dir);
        if (it == pathModules.end()) {
            *why = "no daemon module serves the server directory " + dir;
            return std::string();
        }
        return it->second + "/" + module + "/";
    }
    std::string rest = StripSlashes(dest);
    return rest.empty() ? module + "/" : module + "/" + rest;
}

void RsyncWrapper::Impl::ConnectionOptions(std::vector<std::string>* argv) const {
    if (timeout > 0) {
        argv->push_back("--timeout=" + std::to_string(timeout));
    }
    if (!ssh) {
        if (connectTimeout > 0) {
            argv->push_back("--contimeout=" + std::to_string(connectTimeout));
        }
        // The daemon protocol trades many small messages; with Nagle's algorithm each one that
        // follows an unacknowledged one waits for the peer's delayed ACK (40 ms and more), four
        // times in a plain run and more in a command. The receiver sets the same on its side.
        argv->push_back("--sockopts=TCP_NODELAY");
        return;
    }
    argv->push_back("--rsh=" + RemoteShell());
    argv->push_back("--rsync-path=rsync --config=" + RemoteConfigPath());
}

std::string RsyncWrapper::Impl::RemoteConfigPath() const {
    return remoteConfig.empty() ? DefaultRemoteConfig() : remoteConfig;
}

std::string RsyncWrapper::Impl::RemoteShell() const {
    std::string rsh;
    bool withPassword = !password.empty() && identity.empty();
    if (withPassword) {
        rsh = "sshpass -e ";
    }
    rsh += "ssh";
    if (port > 0) {
        rsh += " -p " + std::to_string(port);
    }
    if (connectTimeout > 0) {
        rsh += " -o ConnectTimeout=" + std::to_string(connectTimeout);
    }
    rsh += " -o StrictHostKeyChecking=accept-new";
    if (!knownHosts.empty()) {
        rsh += " -o UserKnownHostsFile=" + knownHosts;
    }
    if (!identity.empty()) {
        rsh += " -i " + identity + " -o BatchMode=yes";
    } else if (!withPassword) {
        rsh += " -o BatchMode=yes";
    } else {
        rsh += " -o PubkeyAuthentication=no";
    }
    if (auth) {
        rsh += " -l " + user;
    }
    return rsh;
}

void RsyncWrapper::Impl::Environment(ChildCommand* job) const {
    job->unset_env = {"RSYNC_PASSWORD", "SSHPASS", "RSYNC_CONNECT_PROG", "RSYNC_RSH",
                      "RSYNC_PROXY"};
    if (auth && !password.empty()) {
        job->set_env.push_back(std::make_pair("RSYNC_PASSWORD", password));
        if (ssh && identity.empty()) {
            job->set_env.push_back(std::make_pair("SSHPASS", password));
        }
    }
}

int RsyncWrapper::Impl::Run(ChildCommand& job, const boost::function<bool()>& cancel,
                            bool commandRun) {
    std::list<std::string> errors;
    bool unknownCommandModule = false;
    bool deletionsStopped = false;
    bool hookFailed = false;
    bool usageError = false;
    bool noGreeting = false;
    int lastPercent = -1;
    const std::string unknownModule = "Unknown module '" + commandModule + "'";
    auto sink = [&](const std::string& raw) {
        std::string line = raw;
        if (password.size() >= 4) {
            for (size_t at = line.find(password); at != std::string::npos;
                 at = line.find(password, at)) {
                line.replace(at, password.size(), "***");
            }
        }
        if (dryRunItems && line.compare(0, sizeof(kItemPrefix) - 1, kItemPrefix) == 0) {
            // "<change summary> <path>": the summary is one word ("*deleting" is padded).
            const std::string item = line.substr(sizeof(kItemPrefix) - 1);
            const size_t blank = item.find(' ');
            const size_t path = item.find_first_not_of(' ', blank);
            if (blank != std::string::npos && path != std::string::npos) {
                dryRunItems(item.substr(0, blank), item.substr(path));
            }
            return;
        }
        int percent = ProgressPercent(line);
        if (percent >= 0) {
            lastPercent = percent;
            if (progress) {
                progress(percent);
            }
            return;
        }
        if (commandRun && line.find(unknownModule) != std::string::npos) {
            unknownCommandModule = true;
        }
        if (line.find(kEarlyExecFailed) != std::string::npos ||
            line.find(kExecPreparation) != std::string::npos ||
            line.find(std::string(kPreXferFailed) + std::to_string(126 << 8) + ")") !=
                std::string::npos ||
            line.find(std::string(kPreXferFailed) + std::to_string(127 << 8) + ")") !=
                std::string::npos) {
            hookFailed = true;
        }
        usageError = usageError || line.find(kUsageError) != std::string::npos;
        noGreeting = noGreeting || line.find(kNoGreeting) != std::string::npos;
        if (line.compare(0, sizeof(kDeletionsStopped) - 1, kDeletionsStopped) == 0) {
            deletionsStopped = true;
        }
        errors.push_back(line);
        if (errors.size() > kKeptErrorLines) {
            errors.pop_front();
        }
    };
    job.argv.insert(job.argv.begin(), rsyncPath);
    ChildOutcome outcome = S2S::rsync_internal::RunChild(job, cancel, sink);
    lastError.clear();
    for (const auto& e : errors) {
        lastError += e + "\n";
    }
    if (!outcome.started) {
        lastError = outcome.error;
        Logger::LogMsg(Logger::Error, "[ERROR] rsync_wrapper.cpp(%d): Fail to start rsync: %s\n",
                       __LINE__, outcome.error.c_str());
        return kResultSpawn;
    }
    if (outcome.cancelled) {
        Logger::LogMsg(Logger::Info, "[INFO] rsync_wrapper.cpp(%d): rsync cancelled\n", __LINE__);
        return kResultCancelled;
    }
    if (outcome.signal != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] rsync_wrapper.cpp(%d): rsync killed by signal %d\n",
                       __LINE__, outcome.signal);
        return kResultCancelled;
    }
    if (outcome.exit_code == 127) {
        Logger::LogMsg(Logger::Error, "[ERROR] rsync_wrapper.cpp(%d): Fail to execute %s\n",
                       __LINE__, rsyncPath.c_str());
        return kResultSpawn;
    }
    if (outcome.exit_code != 0) {
        std::string last = errors.empty() ? std::string() : errors.back();
        Logger::LogMsg(Logger::Error, "[ERROR] rsync_wrapper.cpp(%d): rsync failed [%d]: %s\n",
                       __LINE__, outcome.exit_code, last.c_str());
        if (unknownCommandModule) {
            return kResultNoCommands;
        }
        if (hookFailed) {
            lastError =
                "the receiving server's command hook could not start or failed (its "
                "daemon log says why)\n" +
                lastError;
            return kResultHookFailed;
        }
        if (ssh && usageError && noGreeting) {
            ForgetSshLogin();
            lastError = SshLoginMessage("started a daemon that could not read (or parse)") + "\n" +
                        lastError;
            return kResultSshLogin;
        }
    }
    if (deletionsStopped && (outcome.exit_code == 0 || outcome.exit_code == kRsyncVanished)) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] rsync_wrapper.cpp(%d): the deletion limit stopped deletions\n",
                       __LINE__);
        return kRsyncDeleteLimit;
    }
    // rsync's overall figure is the share of the tree's bytes it moved: a run that sends little
    // (or rounds its last report down) ends below 100, yet it went through the whole tree. Files
    // that vanished on the way (24) are no longer part of it.
    const bool complete = outcome.exit_code == 0 || outcome.exit_code == kRsyncVanished;
    if (complete && progress && !commandRun && lastPercent != 100) {
        progress(100);
    }
    return outcome.exit_code;
}

int RsyncWrapper::Impl::RefuseRun(const std::string& why) {
    lastError = why;
    Logger::LogMsg(Logger::Error, "[ERROR] rsync_wrapper.cpp(%d): %s\n", __LINE__, why.c_str());
    return kResultUsage;
}

int RsyncWrapper::Impl::ExecuteTransfer(const boost::function<bool()>& cancel) {
    std::string why = CheckConnection();
    std::string target;
    if (why.empty()) {
        target = TransferTarget(&why);
    }
    if (why.empty() && (src.empty() || S2S::protocol::HasControl(src))) {
        why = "no usable source path";
    }
    if (!why.empty()) {
        return RefuseRun(why);
    }

    ChildCommand job;
    std::vector<std::string>& a = job.argv;
    // --hard-links costs nothing measurable where there are no hard links (rsync tracks only files
    // with more than one link) and keeps them where there are: always asked for.
    // rsync's quick check compares whole seconds by default: a file rewritten with the same size
    // within the second of the last run, and a folder's time, would be taken as unchanged. A
    // negative window compares the nanoseconds too.
    a = {"--recursive", "--links", "--perms", "--times", "--modify-window=-1", "--hard-links"};
    if (!listOnly && !dryRunItems &&
        (filesFrom.empty() ? HoldsSparseFile(src) : ListHoldsSparseFile(src, filesFrom))) {
        a.push_back("--sparse");
    }
    if (pseudoRoot) {
        // The daemon writes as root: owners, groups and special files are kept as sent.
        a.insert(a.end(), {"--owner", "--group", "--devices", "--specials"});
    }
    if (numericIds) {
        a.push_back("--numeric-ids");
    }
    if (deleteExtraneous) {
        a.push_back("--delete");
        if (maxDelete >= 0) {
            a.push_back("--max-delete=" + std::to_string(maxDelete));
        }
    }
    if (dryRunItems) {
        // Twice: unchanged entries are listed too, so the receiver's side can be counted.
        a.insert(a.end(), {"--dry-run", "--itemize-changes", "--itemize-changes",
                           std::string("--out-format=") + kItemPrefix + "%i %n"});
    }
    if (!filesFrom.empty()) {
        a.insert(a.end(), {"--files-from=" + filesFrom, "--from0", "--delete-missing-args"});
    }
    if (compress) {
        a.push_back("--compress");
    }
    a.push_back(delta ? "--no-whole-file" : "--whole-file");
    if (listOnly) {
        a.push_back("--list-only");
    }
    if (relative) {
        a.push_back("--relative");
    }
    if (acl) {
        a.insert(a.end(), {"--acls", "--xattrs"});
    }
    if (debugLog) {
        std::string log = logFile.empty() ? S2SPath(kDefaultLogFile) : logFile;
        MakeParentDir(log);
        RotateLog(log, kLogRotateBytes, kLogKeep);
        a.push_back("--log-file=" + log);
    }
    if (bwlimit > 0) {
        a.push_back("--bwlimit=" + std::to_string(bwlimit));
    }
    if (progress) {
        a.push_back("--info=progress2");
    }
    ConnectionOptions(&a);
    for (const auto& rule : excludes) {
        a.push_back("--exclude=" + rule);
    }
    a.push_back("--");
    a.push_back(src);
    a.push_back(Url(target));
    Environment(&job);
    return Run(job, cancel, false);
}

bool RsyncWrapper::credentialsFit(const std::string& user, const std::string& password) {
    return user.size() + 1 + password.size() <= kMaxSecretLine;
}

RsyncWrapper::RsyncWrapper() : impl_(new Impl) {}
RsyncWrapper::~RsyncWrapper() = default;

void RsyncWrapper::setSrcPath(std::string path) {
    impl_->src = std::move(path);
}
void RsyncWrapper::setDestPath(std::string server, std::string user, std::string password,
                               std::string dest, std::string module) {
    impl_->server = std::move(server);
    impl_->user = std::move(user);
    impl_->password = std::move(password);
    impl_->dest = std::move(dest);
    impl_->module = std::move(module);
}
void RsyncWrapper::setSsh(bool on) {
    impl_->ssh = on;
}
void RsyncWrapper::setPort(int port) {
    impl_->port = port;
}
void RsyncWrapper::setCompress(bool on) {
    impl_->compress = on;
}
void RsyncWrapper::setDeltaCopy(bool on) {
    impl_->delta = on;
}
void RsyncWrapper::setListOnly(bool on) {
    impl_->listOnly = on;
}
void RsyncWrapper::setRelativePath(bool on) {
    impl_->relative = on;
}
void RsyncWrapper::setNumericIds(bool on) {
    impl_->numericIds = on;
}
void RsyncWrapper::setDelete(bool on) {
    impl_->deleteExtraneous = on;
}
void RsyncWrapper::setTimeout(int seconds) {
    impl_->timeout = seconds;
}
void RsyncWrapper::setDebugLog(bool on) {
    impl_->debugLog = on;
}
void RsyncWrapper::setExcludeRule(std::list<std::string> rules) {
    impl_->excludes = std::move(rules);
}
void RsyncWrapper::setVurnAcl(bool on) {
    impl_->acl = on;
}
void RsyncWrapper::setVurnAuth(bool on, bool strict) {
    impl_->auth = on;
    impl_->authStrict = strict;
}
void RsyncWrapper::setVurnPseudoRoot(bool on) {
    impl_->pseudoRoot = on;
}
void RsyncWrapper::setVurnCustCmdRule(std::list<std::string> lines) {
    impl_->cmdLines = std::move(lines);
}
void RsyncWrapper::setRsyncPath(std::string path) {
    impl_->rsyncPath = std::move(path);
}
void RsyncWrapper::setConnectTimeout(int seconds) {
    impl_->connectTimeout = seconds;
}
void RsyncWrapper::setCommandModule(std::string module) {
    impl_->commandModule = std::move(module);
}
void RsyncWrapper::setServerPathModule(std::string serverPath, std::string module) {
    while (serverPath.size() > 1 && serverPath.back() == '/') {
        serverPath.pop_back();
    }
    impl_->pathModules[serverPath] = std::move(module);
}
void RsyncWrapper::setLogFile(std::string path) {
    impl_->logFile = std::move(path);
}
void RsyncWrapper::setBandwidthLimit(unsigned kibPerSecond) {
    impl_->bwlimit = kibPerSecond;
}
void RsyncWrapper::setRemoteConfig(std::string path) {
    impl_->remoteConfig = std::move(path);
}
void RsyncWrapper::setSshKnownHostsFile(std::string path) {
    impl_->knownHosts = std::move(path);
}
void RsyncWrapper::setSshIdentityFile(std::string path) {
    impl_->identity = std::move(path);
}
void RsyncWrapper::setProgressCallback(boost::function<void(int)> callback) {
    impl_->progress = std::move(callback);
}
void RsyncWrapper::setMaxDelete(long long count) {
    impl_->maxDelete = count;
}
void RsyncWrapper::setDryRun(
    boost::function<void(const std::string& change, const std::string& path)> callback) {
    impl_->dryRunItems = std::move(callback);
}
void RsyncWrapper::setFilesFrom(std::string listFile) {
    impl_->filesFrom = std::move(listFile);
}

int RsyncWrapper::execute(boost::function<bool()> cancel) {
    impl_->lastError.clear();
    // Malformed settings are reported by the run below, before anything is started.
    if (impl_->ssh && impl_->CheckConnection().empty()) {
        const int checked = impl_->CheckSshLogin(cancel);
        if (checked != 0) {
            return checked;
        }
    }
    if (!impl_->cmdLines.empty()) {
        return impl_->ExecuteCommand(cancel);
    }
    return impl_->ExecuteTransfer(cancel);
}

std::string RsyncWrapper::lastError() const {
    return impl_->lastError;
}

}  // namespace Backup
}  // namespace VURN
