// The receiver's rsync daemon: its configuration written from the share registry (and its share
// modules brought up to date when the registry changes), its start and stop under one lock, and
// the status a status page shows.
#include <arpa/inet.h>
#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <netinet/in.h>
#include <poll.h>
#include <pwd.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <sstream>
#include <thread>
#include <vector>

#include "core/protocol.h"
#include "host/pairing_store.h"
#include "platform/env.h"
#include "platform/records.h"
#include "receiver/internal.h"
#include "s2s_logger.h"
#include "s2s_platform.h"
#include "s2s_receiver.h"
#include "s2s_server.h"

namespace S2S {

namespace {

constexpr auto kStartWait = std::chrono::seconds(10);
constexpr auto kStopWait = std::chrono::seconds(10);
constexpr auto kKillWait = std::chrono::seconds(5);

int Fail(std::string* error, const std::string& text) {
    Logger::LogMsg(Logger::Error, "[ERROR] receiver_daemon.cpp(%d): %s\n", __LINE__, text.c_str());
    if (error != nullptr) {
        *error = text;
    }
    return -1;
}

// A value rsyncd.conf takes literally: no line breaks, no %VAR% expansion, no outer blanks, and
// (for what goes into a hook's shell command) no single quote.
bool ConfSafe(const std::string& s) {
    return !s.empty() && !protocol::HasControl(s) && s.find_first_of("%'\\") == std::string::npos &&
           s.front() != ' ' && s.back() != ' ';
}

bool ValidAccount(const std::string& s) {
    if (s.empty() || s.size() > 64 || s[0] == '-') {
        return false;
    }
    for (unsigned char c : s) {
        if (!(std::isalnum(c) || c == '.' || c == '_' || c == '-')) {
            return false;
        }
    }
    return true;
}

bool ValidAddress(const std::string& s) {
    if (s.empty()) {
        return true;
    }
    unsigned char buf[sizeof(struct in6_addr)];
    return inet_pton(AF_INET, s.c_str(), buf) == 1 || inet_pton(AF_INET6, s.c_str(), buf) == 1;
}

void MakeDirs(const std::string& dir, mode_t mode) {
    s2s_platform::Env::Default()->MakeDirs(dir, mode);
}

std::string Parent(const std::string& path) {
    size_t slash = path.rfind('/');
    return slash == std::string::npos || slash == 0 ? std::string("/") : path.substr(0, slash);
}

// Replaces a file whole, with `mode` from the start. Only called under the administration lock,
// so a temporary file a writer that died left behind is stale.
bool WriteFileAtomic(const std::string& path, const std::string& content, mode_t mode) {
    s2s_platform::ReplaceOptions options;
    options.mode = mode;
    options.sweep_stale = true;
    return s2s_platform::Env::Default()->ReplaceFile(path, content, options) == 0;
}

std::string Quote(const std::string& s) {
    return "'" + s + "'";
}

pid_t PidFromFile() {
    std::ifstream in(S2SPath(S2S_PATH_RSYNCD_PID));
    long pid = 0;
    if (!(in >> pid) || pid <= 1) {
        return -1;
    }
    return static_cast<pid_t>(pid);
}

// Alive and not a zombie (a daemon whose parent left may stay a zombie for a while).
bool ProcessAlive(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
    std::string stat;
    if (!std::getline(in, stat)) {
        return false;
    }
    size_t paren = stat.rfind(')');
    return paren != std::string::npos && paren + 2 < stat.size() && stat[paren + 2] != 'Z';
}

bool Accepting(const std::string& address, int port) {
    std::string host = address.empty() ? "127.0.0.1" : address;
    bool v6 = host.find(':') != std::string::npos;
    int fd = socket(v6 ? AF_INET6 : AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return false;
    }
    int rc = -1;
    if (v6) {
        sockaddr_in6 a{};
        a.sin6_family = AF_INET6;
        a.sin6_port = htons(static_cast<uint16_t>(port));
        inet_pton(AF_INET6, host.c_str(), &a.sin6_addr);
        rc = connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a);
    } else {
        sockaddr_in a{};
        a.sin_family = AF_INET;
        a.sin_port = htons(static_cast<uint16_t>(port));
        inet_pton(AF_INET, host.c_str(), &a.sin_addr);
        rc = connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a);
    }
    close(fd);
    return rc == 0;
}

// The inodes of the TCP sockets listening on `port` (IPv4 and IPv6).
std::vector<std::string> ListeningInodes(int port) {
    std::vector<std::string> inodes;
    char hexPort[8];
    std::snprintf(hexPort, sizeof hexPort, "%04X", port);
    for (const char* table : {"/proc/net/tcp", "/proc/net/tcp6"}) {
        std::ifstream in(table);
        std::string line;
        std::getline(in, line);  // the header
        while (std::getline(in, line)) {
            std::istringstream fields(line);
            std::string slot, local, remote, state, queues, timer, retr, uid, timeout, inode;
            fields >> slot >> local >> remote >> state >> queues >> timer >> retr >> uid >>
                timeout >> inode;
            size_t colon = local.rfind(':');
            if (state == "0A" && colon != std::string::npos && local.substr(colon + 1) == hexPort) {
                inodes.push_back(inode);
            }
        }
    }
    return inodes;
}

// True when process `pid` itself holds a socket listening on `port`: a daemon that could not
// bind must not be taken for one that did because someone else listens there.
bool ListensOn(pid_t pid, int port) {
    std::vector<std::string> inodes = ListeningInodes(port);
    std::string dir = "/proc/" + std::to_string(pid) + "/fd";
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return false;
    }
    bool found = false;
    while (struct dirent* e = readdir(d)) {
        char target[64];
        ssize_t n = readlink((dir + "/" + e->d_name).c_str(), target, sizeof target - 1);
        if (n <= 0) {
            continue;
        }
        target[n] = '\0';
        for (const auto& inode : inodes) {
            found = found || std::string(target) == "socket:[" + inode + "]";
        }
    }
    closedir(d);
    return found;
}

// "port = N" and "address = A" back from the written configuration.
void ListenSettings(int* port, std::string* address) {
    std::ifstream in(S2SPath(S2S_PATH_RSYNCD_CONF));
    std::string line;
    *port = 873;
    address->clear();
    while (std::getline(in, line) && (line.empty() || line[0] != '[')) {
        if (line.compare(0, 7, "port = ") == 0) {
            *port = std::atoi(line.c_str() + 7);
        } else if (line.compare(0, 10, "address = ") == 0) {
            *address = line.substr(10);
        }
    }
}

int SetEnabled(bool on) {
    HashRecord h(VLIBCSzHashAlloc(2));
    VLIBSzHash* raw = h.release();
    int rc = VLIBCSzHashSetValue(&raw, "s2sEnabled", on ? "yes" : "no");
    h.reset(raw);
    if (rc < 0) {
        return -1;
    }
    S2SCheckServerInfo();
    return S2SUpdateServerInfo("PairedClientInfo", h.get());
}

std::string LogTail() {
    std::ifstream in(S2SPath(S2S_PATH_RSYNCD_LOG));
    std::string line;
    std::string last;
    while (std::getline(in, line)) {
        if (!line.empty()) {
            last = line;
        }
    }
    return last;
}

// What /proc tells of one process: its parent, its process group, and whether it is only a
// zombie (a finished process whose new parent has not reaped it yet).
struct ProcEntry {
    pid_t pid = 0;
    pid_t ppid = 0;
    pid_t pgrp = 0;
    bool zombie = false;
};

std::vector<ProcEntry> ProcessTable() {
    std::vector<ProcEntry> table;
    DIR* d = opendir("/proc");
    if (d == nullptr) {
        return table;
    }
    while (struct dirent* e = readdir(d)) {
        char* end = nullptr;
        long pid = std::strtol(e->d_name, &end, 10);
        if (end == e->d_name || *end != '\0' || pid <= 0) {
            continue;
        }
        std::ifstream in(std::string("/proc/") + e->d_name + "/stat");
        std::string stat;
        if (!std::getline(in, stat)) {
            continue;  // ended meanwhile
        }
        // "pid (comm) state ppid pgrp ...": the name may hold blanks and parentheses.
        size_t paren = stat.rfind(')');
        if (paren == std::string::npos) {
            continue;
        }
        std::istringstream fields(stat.substr(paren + 1));
        char state = 0;
        long ppid = 0;
        long pgrp = 0;
        if (!(fields >> state >> ppid >> pgrp)) {
            continue;
        }
        ProcEntry p;
        p.pid = static_cast<pid_t>(pid);
        p.ppid = static_cast<pid_t>(ppid);
        p.pgrp = static_cast<pid_t>(pgrp);
        p.zombie = state == 'Z' || state == 'X';
        table.push_back(p);
    }
    closedir(d);
    return table;
}

// The live processes that belong to the daemon `pid`: itself, its process group when it leads
// one (connections whose parent has already gone keep the group), and the descendants of all of
// these.
std::vector<pid_t> DaemonProcesses(pid_t pid, bool leads) {
    std::vector<ProcEntry> table = ProcessTable();
    std::set<pid_t> found;
    std::vector<pid_t> todo;
    for (const ProcEntry& p : table) {
        if (p.pid == pid || (leads && p.pgrp == pid)) {
            found.insert(p.pid);
            todo.push_back(p.pid);
        }
    }
    while (!todo.empty()) {
        pid_t parent = todo.back();
        todo.pop_back();
        for (const ProcEntry& p : table) {
            if (p.ppid == parent && found.insert(p.pid).second) {
                todo.push_back(p.pid);
            }
        }
    }
    std::vector<pid_t> live;
    for (const ProcEntry& p : table) {
        if (found.count(p.pid) != 0 && !p.zombie) {
            live.push_back(p.pid);
        }
    }
    return live;
}

// Sends `signo` to each process and waits (at most `wait`) until one of them ends. A pidfd turns
// readable the moment its process ends, so no time is lost to polling.
void SignalAndAwaitOne(const std::vector<pid_t>& pids, int signo, std::chrono::milliseconds wait) {
    std::vector<struct pollfd> fds;
    for (pid_t p : pids) {
        int fd = static_cast<int>(syscall(SYS_pidfd_open, p, 0));
        if (fd >= 0) {
            if (syscall(SYS_pidfd_send_signal, fd, signo, nullptr, 0) != 0) {
                close(fd);
                continue;  // ended meanwhile
            }
            fds.push_back({fd, POLLIN, 0});
        } else if (errno != ESRCH) {
            kill(p, signo);  // a kernel without pidfds
        }
    }
    if (fds.size() == pids.size() && !fds.empty()) {
        while (poll(fds.data(), fds.size(), static_cast<int>(wait.count())) < 0 && errno == EINTR) {
        }
    } else if (!pids.empty()) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    for (const auto& f : fds) {
        close(f.fd);
    }
}

// Ends the daemon and every process it forked for its connections (their hooks included):
// SIGTERM first, SIGKILL for what is left after kStopWait. True once none of them lives.
bool EndDaemon(pid_t pid, bool leads) {
    auto deadline = std::chrono::steady_clock::now() + kStopWait;
    int signo = SIGTERM;
    for (;;) {
        std::vector<pid_t> left = DaemonProcesses(pid, leads);
        if (left.empty()) {
            return true;
        }
        auto now = std::chrono::steady_clock::now();
        if (now >= deadline) {
            if (signo == SIGKILL) {
                return false;
            }
            signo = SIGKILL;
            deadline = now + kKillWait;
            continue;
        }
        auto remaining = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - now);
        SignalAndAwaitOne(left, signo, std::min(remaining, std::chrono::milliseconds(200)));
    }
}

}  // namespace

namespace receiver_internal {

bool WriteAll(int fd, const std::string& content) {
    size_t done = 0;
    while (done < content.size()) {
        ssize_t n = write(fd, content.data() + done, content.size() - done);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        done += static_cast<size_t>(n);
    }
    return true;
}

int ShareEncrypted(const std::string& name, bool* encrypted) {
    VURNShare* raw = nullptr;
    if (VURNShareGet(name.c_str(), &raw) < 0) {
        return VLIBCErrGet() == VLIB_ERR_NOT_FOUND ? 0 : -1;
    }
    ShareRecord share(raw);
    int value = 0;
    if (VLIBShareIsEncryptionGet(share.get(), &value) < 0) {
        return -1;
    }
    *encrypted = value != 0;
    return 1;
}

}  // namespace receiver_internal

namespace {

// Starts the part of the configuration that is rewritten from the share registry; everything
// above it is written by `configure` alone.
const char kShareMarker[] = "# Share modules, rewritten from the share registry when it changes.\n";
// Present in the share part when some share may receive device files: the daemon then keeps the
// right to create them (read by `start`).
const char kDevicesLine[] = "# device files: allowed\n";

// Holds the receiver's administration lock: configure, start, stop and a refresh of the share
// modules never overlap (a second start would otherwise take the first one's daemon for its own
// failed one and end it through the pid file).
class AdminLock {
  public:
    AdminLock() {
        const std::string path = S2SPath(S2S_PATH_RECEIVER_LOCK);
        MakeDirs(Parent(path), 0755);
        lock_ = s2s_platform::Env::Default()->LockPath(path, false);
    }
    bool held() const { return lock_.held(); }

  private:
    s2s_platform::FileLock lock_;
};

// Key files are private to root: directories 0700, files 0600, whatever an earlier version or a
// transfer left. Symbolic links are neither followed nor changed.
void TightenKeys(const std::string& dir, int depth) {
    chmod(dir.c_str(), 0700);
    DIR* d = depth > 0 ? opendir(dir.c_str()) : nullptr;
    if (d == nullptr) {
        return;
    }
    while (struct dirent* e = readdir(d)) {
        std::string name = e->d_name;
        struct stat st;
        std::string path = dir + "/" + name;
        if (name == "." || name == ".." || lstat(path.c_str(), &st) != 0) {
            continue;
        }
        if (S_ISDIR(st.st_mode)) {
            TightenKeys(path, depth - 1);
        } else if (S_ISREG(st.st_mode)) {
            chmod(path.c_str(), 0600);
        }
    }
    closedir(d);
}

// The share modules from the share registry. Names that cannot be modules are skipped with a
// note; two shares the daemon would serve as one module fail the whole set.
int ShareModules(std::string* text, std::vector<std::string>* notes, std::string* error) {
    VLIBSzList* rawNames = VLIBCSzListAlloc(16);
    int count = VURNShareEnum(&rawNames);
    ListRecord names(rawNames);
    if (count < 0 && VLIBCErrGet() != VLIB_ERR_FILE_NOT_FOUND) {
        return Fail(error, "cannot read the share registry");
    }
    std::ostringstream c;
    std::map<std::string, std::string> modules;  // module key -> share
    bool devices = false;
    for (int i = 0; i < VLIBCSzListCount(names.get()); ++i) {
        std::string name = VLIBCSzListGet(names.get(), i);
        VURNShare* raw = nullptr;
        if (VURNShareGet(name.c_str(), &raw) < 0) {
            return Fail(error, "cannot read the share " + name);
        }
        ShareRecord share(raw);
        std::string path = share->path;
        // A syncable name is also a literal value of the configuration (no quote, '%', control
        // character or outer blank), so only the path needs that check of its own.
        if (!protocol::ShareNameSyncable(name) || path.empty() || path[0] != '/' ||
            !ConfSafe(path)) {
            std::string shown = protocol::HasControl(name) ? "?" : name;
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] receiver_daemon.cpp(%d): share '%s' is not served (its name "
                           "or path cannot be a daemon module)\n",
                           __LINE__, shown.c_str());
            if (notes != nullptr) {
                notes->push_back("share '" + shown +
                                 "' is not served: its name or path cannot be a daemon module "
                                 "(quotes, '%', '..', a leading '@', two blanks in a row, or "
                                 "the name global)");
            }
            continue;
        }
        auto taken = modules.emplace(protocol::ShareModuleKey(name), name);
        if (!taken.second) {
            return Fail(error, "shares '" + taken.first->second + "' and '" + name +
                                   "' would be served as one module (names may not differ only "
                                   "in letter case or blanks): rename one of them");
        }
        const bool special = (share->status & VURN_SHARE_STATUS_SPECIAL_FILES) != 0;
        devices = devices || special;
        // Clients push; nothing is read back. Setuid and setgid bits of received files and
        // directories are dropped unless the share asks to keep them.
        std::string module = "\tpath = " + path + "\n\twrite only = yes\n";
        if (!special) {
            module += "\tincoming chmod = Dug-s,Fug-s\n";
        }
        c << "[" << name << "]\n" << module << "\n";
        if ((share->status & VURN_SHARE_STATUS_ENCRYPTED) != 0) {
            char buf[4096];
            if (VLIBShareEncryptPathGet(path.c_str(), buf, sizeof buf) < 0 || !ConfSafe(buf)) {
                return Fail(error, "cannot find the encrypted directory of " + name);
            }
            MakeDirs(buf, 0700);
            std::string encrypted =
                "\tpath = " + std::string(buf) + module.substr(module.find('\n'));
            c << "[@" << name << "@]\n" << encrypted << "\n";
        }
    }
    *text = std::string(kShareMarker) + (devices ? kDevicesLine : "") + "\n" + c.str();
    return 0;
}

int ConfigureLocked(const ReceiverSettings& s, std::string* error,
                    std::vector<std::string>* notes) {
    if (s.port <= 0 || s.port > 65535) {
        return Fail(error, "invalid port");
    }
    if (s.maxConnections <= 0 || s.maxConnections > 10000) {
        return Fail(error, "invalid connection limit (1 to 10000)");
    }
    if (!ValidAddress(s.address)) {
        return Fail(error, "invalid listen address");
    }
    if (!ValidAccount(s.user)) {
        return Fail(error, "invalid user name (letters, digits, '.', '_', '-')");
    }
    if (s.password.empty() || protocol::HasControl(s.password)) {
        return Fail(error, "the password must be one non-empty line");
    }
    if (s.handlerPath.empty() || s.handlerPath[0] != '/' || !ConfSafe(s.handlerPath)) {
        return Fail(error, "the handler program needs an absolute path without quotes or '%'");
    }
    const std::string conf = S2SPath(S2S_PATH_RSYNCD_CONF);
    const std::string secrets = S2SPath(S2S_PATH_RSYNCD_SECRETS);
    const std::string spool = S2SPath(S2S_PATH_COMMAND_SPOOL);
    const std::string keys = S2SPath(S2S_PATH_KEY_DIR);
    const std::string pid = S2SPath(S2S_PATH_RSYNCD_PID);
    const std::string log = S2SPath(S2S_PATH_RSYNCD_LOG);
    const std::string lock = S2SPath(S2S_PATH_RSYNCD_LOCK);
    for (const std::string* p : {&conf, &secrets, &spool, &keys, &pid, &log, &lock}) {
        if (!ConfSafe(*p)) {
            return Fail(error, "path not usable in the daemon configuration: " + *p);
        }
    }
    const char* root = std::getenv("S2S_ROOT");
    std::string rootValue = root != nullptr ? root : "";
    if (!rootValue.empty() && !ConfSafe(rootValue)) {
        return Fail(error, "S2S_ROOT not usable in the daemon configuration");
    }
    std::string shares;
    if (ShareModules(&shares, notes, error) != 0) {
        return -1;
    }
    for (const std::string& dir : {Parent(conf), Parent(pid), Parent(log), Parent(lock)}) {
        MakeDirs(dir, 0755);
    }
    MakeDirs(spool + "/replies", 0700);
    MakeDirs(spool + "/conns", 0700);
    // The command module reads replies as an unprivileged user that may enter the replies
    // directory but not list it: a reply is read by its token only. Nobody else gets past the
    // spool itself.
    if (chmod(spool.c_str(), 0700) != 0 || chmod((spool + "/replies").c_str(), 0711) != 0) {
        return Fail(error, "cannot set the modes of " + spool + ": " + strerror(errno));
    }
    uid_t readerUid = 65534;
    gid_t readerGid = 65534;
    if (const struct passwd* pw = getpwnam("nobody")) {
        readerUid = pw->pw_uid;
        readerGid = pw->pw_gid;
    }
    MakeDirs(keys, 0700);
    TightenKeys(keys, 2);

    std::ostringstream c;
    c << "# Written by s2s-receiver configure; rewritten on every configure.\n"
      << "pid file = " << pid << "\n"
      << "port = " << s.port << "\n";
    if (!s.address.empty()) {
        c << "address = " << s.address << "\n";
    }
    c << "lock file = " << lock << "\n"
      << "log file = " << log
      << "\n"
      // Every module is a chroot: no client path can leave its module.
      << "use chroot = yes\n"
      << "numeric ids = yes\n"
      << "uid = 0\n"
      << "gid = 0\n"
      << "read only = no\n"
      << "list = no\n"
      << "reverse lookup = no\n"
      << "auth users = " << s.user << "\n"
      << "secrets file = " << secrets << "\n"
      << "strict modes = yes\n"
      << "timeout = 900\n"
      // Connections per module at once (the daemon counts them in the lock file).
      << "max connections = " << s.maxConnections
      << "\n"
      // Small protocol messages go out at once instead of waiting for the peer's delayed ACK.
      << "socket options = TCP_NODELAY\n\n";

    // The hooks run through the daemon's shell: every value is single-quoted and was checked to
    // hold no quote. Their error output goes to the daemon's log, so that a hook that cannot
    // even start (a library it cannot load) says why there. The shell replaces itself with the
    // handler instead of forking it.
    std::string hook = "S2S_ROOT=" + Quote(rootValue) + "; export S2S_ROOT; [ -w " + Quote(log) +
                       " ] && exec 2>>" + Quote(log) + "; exec " + Quote(s.handlerPath) + " ";
    c << "[" << S2S_COMMAND_MODULE << "]\n"
      << "\tpath = " << spool << "/replies\n"
      << "\tread only = yes\n"
      << "\tuid = " << readerUid << "\n"
      << "\tgid = " << readerGid
      << "\n"
      // One hook process per command: it answers, and a watcher it leaves removes the reply
      // when the connection ends.
      << "\tearly exec = " << hook << "hook-early" << (s.oldServer ? " --old-server" : "")
      << "\n\n";
    c << "[" << S2S_KEY_MODULE << "]\n"
      << "\tpath = " << keys
      << "\n"
      // Every client run carries --delete; on a single key file it removes nothing, so the key
      // module must not refuse it. Keys arrive private to root, each into the directory of one
      // registered encrypted share (the hook refuses any other destination).
      << "\twrite only = yes\n"
      << "\tincoming chmod = D700,F600\n"
      << "\tpre-xfer exec = " << hook << "hook-key\n\n";
    c << shares;

    if (!WriteFileAtomic(secrets, s.user + ":" + s.password + "\n", 0600)) {
        return Fail(error, "cannot write " + secrets + ": " + strerror(errno));
    }
    // Private: it names every share's path, and only root's daemon reads it.
    if (!WriteFileAtomic(conf, c.str(), 0600)) {
        return Fail(error, "cannot write " + conf + ": " + strerror(errno));
    }
    return 0;
}

}  // namespace

namespace receiver_internal {

int RefreshShareModules(std::string* error) {
    const std::string conf = S2SPath(S2S_PATH_RSYNCD_CONF);
    std::ifstream in(conf);
    if (!in) {
        struct stat st;
        // Not configured: no daemon reads modules yet.
        return stat(conf.c_str(), &st) != 0 && errno == ENOENT
                   ? 0
                   : Fail(error, conf + " cannot be read");
    }
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    size_t marker = text.find(kShareMarker);
    if (marker == std::string::npos) {
        return Fail(error, conf + " was written by an earlier version: run s2s-receiver configure");
    }
    std::string shares;
    if (ShareModules(&shares, nullptr, error) != 0) {
        return -1;
    }
    if (text.compare(marker, std::string::npos, shares) == 0) {
        return 0;
    }
    AdminLock lock;
    if (!lock.held()) {
        return Fail(error, std::string("cannot take the receiver's lock: ") + strerror(errno));
    }
    // Read again under the lock: a configure may have rewritten the file meanwhile.
    std::ifstream again(conf);
    text.assign((std::istreambuf_iterator<char>(again)), std::istreambuf_iterator<char>());
    marker = text.find(kShareMarker);
    if (marker == std::string::npos || ShareModules(&shares, nullptr, error) != 0) {
        return marker == std::string::npos ? Fail(error, conf + " changed meanwhile") : -1;
    }
    if (!WriteFileAtomic(conf, text.substr(0, marker) + shares, 0600)) {
        return Fail(error, "cannot write " + conf + ": " + strerror(errno));
    }
    return 0;
}

}  // namespace receiver_internal

int ReceiverConfigure(const ReceiverSettings& s, std::string* error,
                      std::vector<std::string>* notes) {
    AdminLock lock;
    if (!lock.held()) {
        return Fail(error, std::string("cannot take the receiver's lock: ") + strerror(errno));
    }
    return ConfigureLocked(s, error, notes);
}

namespace {

int StopLocked(std::string* error);

// Whether the written configuration lets the daemon create device files (some share asks).
bool DevicesAllowed(const std::string& conf) {
    std::ifstream in(conf);
    std::string line;
    while (std::getline(in, line)) {
        if (line + "\n" == kDevicesLine) {
            return true;
        }
    }
    return false;
}

int StartLocked(std::string* error) {
    const std::string conf = S2SPath(S2S_PATH_RSYNCD_CONF);
    struct stat st;
    if (stat(conf.c_str(), &st) != 0) {
        return Fail(error, "not configured: " + conf + " is missing");
    }
    if (ReceiverRunning()) {
        return Fail(error, "the daemon is running already");
    }
    // The service's state lives in the pairing store: a store that cannot be written means a
    // daemon nobody could tell is running, so it is not started at all.
    if (SetEnabled(true) != 0) {
        return Fail(error, std::string("the pairing store ") + S2SPath(S2S_PATH_PAIRING_STORE) +
                               " cannot be written (" + VLIBCErrStr(VLIBCErrGet()) +
                               "): the daemon was not started");
    }
    unlink(S2SPath(S2S_PATH_RSYNCD_PID));
    std::string rsync = s2s_platform::FindProgram("rsync");
    if (rsync.empty()) {
        SetEnabled(false);
        return Fail(error, "rsync is not installed");
    }
    int port = 873;
    std::string address;
    ListenSettings(&port, &address);
    const bool devices = DevicesAllowed(conf);

    // The daemon outlives this program in a session of its own and stays in the foreground of
    // it (--no-detach), so that the pid it writes is the one to stop. It leads its session and
    // process group: every connection process and hook it forks stays in that group, which is
    // how a stop finds and ends them all.
    s2s_platform::SpawnSpec launch;
    launch.program = rsync;
    launch.argv = {rsync, "--daemon", "--no-detach", "--config=" + conf};
    launch.detached = true;
    launch.close_other_fds = true;
    // Unless a share asks for them, neither the daemon nor anything it starts can create device
    // files, whatever a client sends (rsync's option refusal does not hold for -D).
    launch.drop_mknod = !devices;
    // Module names are matched with ASCII case folding only, as the share registry assumes
    // (VURNShareModuleKey).
    launch.set_env = {{"LC_ALL", "C"}};
    // A daemon that cannot be executed, or dies before it writes its pid file (a port in use),
    // is noticed below by its end.
    pid_t started = s2s_platform::Env::Default()->Spawn(launch, nullptr);
    if (started <= 0) {
        SetEnabled(false);
        return Fail(error, "cannot start the daemon");
    }
    auto deadline = std::chrono::steady_clock::now() + kStartWait;
    for (;;) {
        pid_t daemon = PidFromFile();
        if (daemon == started && ProcessAlive(daemon) && ListensOn(daemon, port) &&
            Accepting(address, port)) {
            break;
        }
        bool died = !ProcessAlive(started);
        if (died || std::chrono::steady_clock::now() >= deadline) {
            std::string tail = LogTail();
            // Ours only: the lock keeps any other start out, so the pid file names our daemon.
            StopLocked(nullptr);
            return Fail(error, std::string(died ? "the daemon ended" : "the daemon did not start") +
                                   " instead of listening on port " + std::to_string(port) +
                                   (tail.empty() ? "" : ": " + tail));
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return 0;
}

int StopLocked(std::string* error) {
    pid_t pid = PidFromFile();
    if (pid > 0 && ProcessAlive(pid)) {
        // A daemon started before it led its own group is found through its descendants only.
        const bool leads = getpgid(pid) == pid;
        if (!EndDaemon(pid, leads)) {
            return Fail(error, "the daemon or its connections would not stop");
        }
    }
    // Replies of the connections just ended (their watchers went with the daemon's group).
    receiver_internal::RemoveFinishedReplies();
    unlink(S2SPath(S2S_PATH_RSYNCD_PID));
    if (SetEnabled(false) != 0) {
        std::string text = std::string("the daemon is stopped, but the pairing store ") +
                           S2SPath(S2S_PATH_PAIRING_STORE) + " cannot record it (" +
                           VLIBCErrStr(VLIBCErrGet()) + ")";
        Logger::LogMsg(Logger::Warning, "[WARNING] receiver_daemon.cpp(%d): %s\n", __LINE__,
                       text.c_str());
        if (error != nullptr) {
            *error = text;
        }
        return 1;
    }
    return 0;
}

// The connections that are inside a share or key module right now: the daemon's connection
// processes whose root is a module's chroot other than the command module's.
int RunningTransfers(pid_t daemon) {
    const std::string replies = std::string(S2SPath(S2S_PATH_COMMAND_SPOOL)) + "/replies";
    int count = 0;
    for (const ProcEntry& p : ProcessTable()) {
        if (p.ppid != daemon || p.zombie) {
            continue;
        }
        char target[PATH_MAX];
        ssize_t n = readlink(("/proc/" + std::to_string(p.pid) + "/root").c_str(), target,
                             sizeof target - 1);
        if (n <= 0) {
            continue;
        }
        target[n] = '\0';
        count += std::strcmp(target, "/") != 0 && replies != target;
    }
    return count;
}

}  // namespace

bool ReceiverRunning() {
    pid_t pid = PidFromFile();
    return pid > 0 && ProcessAlive(pid);
}

int ReceiverStart(std::string* error) {
    AdminLock lock;
    if (!lock.held()) {
        return Fail(error, std::string("cannot take the receiver's lock: ") + strerror(errno));
    }
    return StartLocked(error);
}

int ReceiverStop(std::string* error) {
    AdminLock lock;
    if (!lock.held()) {
        return Fail(error, std::string("cannot take the receiver's lock: ") + strerror(errno));
    }
    return StopLocked(error);
}

int ReceiverGetStatus(ReceiverStatus* out) {
    *out = ReceiverStatus();
    // What runs is read from the processes themselves, so that it is true also when the pairing
    // store cannot be read.
    out->running = ReceiverRunning();
    out->transfers = out->running ? RunningTransfers(PidFromFile()) : 0;
    s2s_svr_status st{};
    int rc = s2s_svr_get_status(&st);
    out->busy = st.busy != 0;
    out->pairedClientID = st.client_id != nullptr ? st.client_id : "";
    out->pairedServerName = st.server_name != nullptr ? st.server_name : "";
    s2s_svr_put_status(&st);
    const std::string store = S2SPath(S2S_PATH_PAIRING_STORE);
    if (rc != 0) {
        out->storeError = store + " cannot be read (" + VLIBCErrStr(VLIBCErrGet()) + ")";
        return -1;
    }
    PairingStore::StoreContents contents;
    if (PairingStore::ReadStore(&contents) != 0) {
        out->storeError = store + " cannot be read (" + VLIBCErrStr(VLIBCErrGet()) + ")";
        return -1;
    }
    auto seconds = [](const std::optional<std::string>& v) {
        return !v || v->empty() || v->size() > 18 ||
                       v->find_first_not_of("0123456789") != std::string::npos
                   ? 0L
                   : std::atol(v->c_str());
    };
    for (const PairingStore::StoreClient& client : contents.clients) {
        out->clients.push_back({client.clientID, client.serverName});
    }
    for (const PairingStore::StoreShare& stored : contents.shares) {
        ReceiverShareState share;
        share.name = stored.name;
        share.completeID = stored.fields.completeID.value_or("");
        share.lastStart = seconds(stored.fields.lastStart);
        share.lastResult = stored.fields.lastResult.value_or("");
        share.lastTime = seconds(stored.fields.lastTime);
        share.owner = stored.owner;
        switch (stored.binding) {
            case PairingStore::ShareBinding::kRunning:
                share.state = "running";
                break;
            case PairingStore::ShareBinding::kCompleted:
                share.state = "completed";
                break;
            default:
                // A record the store cannot judge binds nobody it could name.
                share.state = "free";
                break;
        }
        out->shares.push_back(share);
    }
    return 0;
}

}  // namespace S2S
