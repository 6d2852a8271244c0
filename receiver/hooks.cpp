// The command module's hooks, run by the rsync daemon for each connection. The spool holds
//   replies/<token>/result, replies/<token>/output   the answer, pulled by the client's run
//   conns/<RSYNC_PID>                                the token of that connection and the
//                                                    connection process's start time
// The early hook answers and leaves a small watcher process that removes the reply and the
// record the moment the connection process ends. The module reads as an unprivileged user from
// a replies directory it may enter but not list, so a connection reads a reply only by its token.
// What a watcher could not remove (the daemon was stopped, a kernel without pidfds) goes with a
// later early hook: records of connections that have ended, and anything older than any command
// may take.
//
// The key module's pre-transfer hook lets a connection write only into the key directory of one
// registered encrypted share.
//
// The pre- and post-transfer hooks did that work in configurations written by earlier versions;
// they are kept for those until the next configure.
#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "core/protocol.h"
#include "receiver/internal.h"
#include "s2s_logger.h"
#include "s2s_platform.h"
#include "s2s_receiver.h"

namespace S2S {

namespace {

constexpr time_t kStaleSeconds = 600;

std::string Spool() {
    return S2SPath(S2S_PATH_COMMAND_SPOOL);
}

// The connection id rsync gives its hooks, when it is a plain decimal number.
std::string ConnectionId() {
    const char* v = std::getenv("RSYNC_PID");
    if (v == nullptr || *v == '\0' || std::strlen(v) > 10) {
        return std::string();
    }
    for (const char* p = v; *p != '\0'; ++p) {
        if (*p < '0' || *p > '9') {
            return std::string();
        }
    }
    return v;
}

// The module's unprivileged user reads replies: files are world-readable, and the spool above
// them (mode 0700) keeps local users out.
bool WriteNew(const std::string& path, const std::string& content, mode_t mode) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, mode);
    if (fd < 0) {
        return false;
    }
    bool ok = fchmod(fd, mode) == 0 && receiver_internal::WriteAll(fd, content);
    return close(fd) == 0 && ok;
}

// The start time of process `pid` in clock ticks since boot ("" when it has ended):
// with the pid it names one process for good, whatever pid reuse does later.
std::string ProcessStart(const std::string& pid) {
    std::ifstream in("/proc/" + pid + "/stat");
    std::string stat;
    if (!std::getline(in, stat)) {
        return std::string();
    }
    size_t paren = stat.rfind(')');
    if (paren == std::string::npos) {
        return std::string();
    }
    std::istringstream fields(stat.substr(paren + 1));
    std::string field;
    // After the name: state is field 3, starttime field 22. A zombie has ended: it only waits
    // for its new parent to collect it.
    for (int i = 3; i <= 22; ++i) {
        if (!(fields >> field) || (i == 3 && (field == "Z" || field == "X"))) {
            return std::string();
        }
    }
    return field;
}

std::string TokenOf(const std::string& conn) {
    std::ifstream in(Spool() + "/conns/" + conn);
    std::string token;
    std::getline(in, token);
    return protocol::ValidToken(token) ? token : std::string();
}

void RemoveStale(const std::string& dir) {
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return;
    }
    time_t now = time(nullptr);
    while (struct dirent* e = readdir(d)) {
        std::string name = e->d_name;
        if (name == "." || name == "..") {
            continue;
        }
        struct stat st;
        std::string path = dir + "/" + name;
        if (lstat(path.c_str(), &st) == 0 && now - st.st_mtime > kStaleSeconds) {
            protocol::RemoveTree(path);
        }
    }
    closedir(d);
}

// Removes the reply that connection record `conn` names, and the record.
void RemoveConnection(const std::string& conn) {
    std::string token = TokenOf(conn);
    if (!token.empty()) {
        protocol::RemoveTree(Spool() + "/replies/" + token);
    }
    unlink((Spool() + "/conns/" + conn).c_str());
}

// Leaves a process behind that waits for the connection process to end and then removes the
// reply and the record. It holds none of the hook's descriptors (the daemon waits for nothing of
// it) and, being forked from a process that may have threads, makes only async-signal-safe calls.
void WatchConnection(const std::string& conn, const std::string& token) {
    int pidfd = static_cast<int>(syscall(SYS_pidfd_open, std::atoi(conn.c_str()), 0));
    if (pidfd < 0) {
        return;  // a later early hook removes it
    }
    const std::string dir = Spool() + "/replies/" + token;
    const std::string result = dir + "/" + protocol::kResultFile;
    const std::string output = dir + "/" + protocol::kOutputFile;
    const std::string record = Spool() + "/conns/" + conn;
    pid_t pid = fork();
    if (pid == 0) {
        int devnull = open("/dev/null", O_RDWR | O_CLOEXEC);
        for (int fd = 0; fd < 3; ++fd) {
            if (devnull < 0 || dup2(devnull, fd) < 0) {
                close(fd);
            }
        }
        // Every descriptor but the pidfd; one call where the kernel has close_range.
        bool closed = pidfd == 3 || close_range(3, static_cast<unsigned>(pidfd) - 1, 0) == 0;
        closed = closed && close_range(static_cast<unsigned>(pidfd) + 1, ~0U, 0) == 0;
        if (!closed) {
            for (int fd = 3; fd < 1024; ++fd) {
                if (fd != pidfd) {
                    close(fd);
                }
            }
        }
        // Not the client's interrupt or hang-up: only the connection's end (or a stop of the
        // daemon, which ends its whole group) ends the watcher.
        signal(SIGHUP, SIG_IGN);
        signal(SIGINT, SIG_IGN);
        struct pollfd pfd = {pidfd, POLLIN, 0};
        while (poll(&pfd, 1, -1) < 0 && errno == EINTR) {
        }
        unlink(result.c_str());
        unlink(output.c_str());
        rmdir(dir.c_str());
        unlink(record.c_str());
        _exit(0);
    }
    close(pidfd);
}

}  // namespace

namespace receiver_internal {

void RemoveFinishedReplies() {
    const std::string conns = Spool() + "/conns";
    DIR* d = opendir(conns.c_str());
    if (d == nullptr) {
        return;
    }
    std::vector<std::string> ended;
    while (struct dirent* e = readdir(d)) {
        std::string conn = e->d_name;
        if (conn.empty() || conn.find_first_not_of("0123456789") != std::string::npos) {
            continue;
        }
        std::ifstream in(conns + "/" + conn);
        std::string token;
        std::string start;
        // A record without a start time was written by an earlier version: its age decides.
        if (std::getline(in, token) && std::getline(in, start) && !start.empty() &&
            ProcessStart(conn) != start) {
            ended.push_back(conn);
        }
    }
    closedir(d);
    for (const auto& conn : ended) {
        RemoveConnection(conn);
    }
}

}  // namespace receiver_internal

int ReceiverHookEarly(int in_fd, bool oldServer) {
    const std::string spool = Spool();
    receiver_internal::RemoveFinishedReplies();
    RemoveStale(spool + "/replies");
    RemoveStale(spool + "/conns");

    // rsync hands over at most about 5 KiB; anything beyond the command file limit is refused by
    // the parser, so reading stops a little past it.
    std::string input;
    char buffer[4096];
    while (input.size() <= protocol::kMaxCommandFile) {
        ssize_t n = read(in_fd, buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            break;
        }
        input.append(buffer, static_cast<size_t>(n));
    }
    std::string conn = ConnectionId();
    std::string start = conn.empty() ? std::string() : ProcessStart(conn);
    ReceiverAnswer answer = ReceiverRunCommand(input, oldServer);
    if (answer.token.empty() || conn.empty() || start.empty()) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] receiver_hooks.cpp(%d): command without reply token or "
                       "connection refused\n",
                       __LINE__);
        return 1;
    }
    const std::string dir = spool + "/replies/" + answer.token;
    // An existing directory means a replayed or colliding token: never answer into it.
    if (mkdir(dir.c_str(), 0755) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] receiver_hooks.cpp(%d): cannot create reply: %s\n",
                       __LINE__, strerror(errno));
        return 1;
    }
    bool ok = chmod(dir.c_str(), 0755) == 0;
    if (answer.hasOutput) {
        ok = ok && answer.output.size() <= protocol::kMaxOutput &&
             WriteNew(dir + "/" + protocol::kOutputFile, answer.output, 0644);
    }
    ok = ok &&
         WriteNew(dir + "/" + protocol::kResultFile, std::to_string(answer.result) + "\n", 0644);
    // A record left by an ended connection whose pid came round again is replaced.
    const std::string record = spool + "/conns/" + conn;
    if (ok && !TokenOf(conn).empty()) {
        RemoveConnection(conn);
    }
    ok = ok && WriteNew(record, answer.token + "\n" + start + "\n", 0600);
    if (!ok) {
        protocol::RemoveTree(dir);
        Logger::LogMsg(Logger::Error, "[ERROR] receiver_hooks.cpp(%d): cannot write reply\n",
                       __LINE__);
        return 1;
    }
    WatchConnection(conn, answer.token);
    return 0;
}

int ReceiverHookPre() {
    std::string conn = ConnectionId();
    std::string token = conn.empty() ? std::string() : TokenOf(conn);
    const char* request = std::getenv("RSYNC_REQUEST");
    std::string base = std::string(S2S_COMMAND_MODULE) + "/" + token;
    if (!token.empty() && request != nullptr && (request == base || request == base + "/")) {
        return 0;
    }
    // Shown to the client: the run fails and its reply stays unread.
    std::printf("this connection may read its own reply only\n");
    return 1;
}

int ReceiverHookKey() {
    const char* request = std::getenv("RSYNC_REQUEST");
    const std::string prefix = std::string(S2S_KEY_MODULE) + "/";
    std::string share;
    if (request != nullptr && std::strncmp(request, prefix.c_str(), prefix.size()) == 0) {
        share = request + prefix.size();
        if (!share.empty() && share.back() == '/') {
            share.pop_back();
        }
    }
    bool encrypted = false;
    if (!protocol::ShareNameSyncable(share) ||
        receiver_internal::ShareEncrypted(share, &encrypted) != 1 || !encrypted) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] receiver_hooks.cpp(%d): key transfer to a destination other "
                       "than an encrypted share's refused\n",
                       __LINE__);
        // Shown to the client.
        std::printf("keys go to %s<encrypted share>/ only\n", prefix.c_str());
        return 1;
    }
    return 0;
}

int ReceiverHookPost() {
    std::string conn = ConnectionId();
    if (conn.empty()) {
        return 1;
    }
    RemoveConnection(conn);
    return 0;
}

}  // namespace S2S
