// The command module's hooks, run by the rsync daemon for each connection. The spool holds
//   replies/<token>/result, replies/<token>/output   the answer, pulled by the client's run
//   conns/<RSYNC_PID>                                the token of that connection
// The early hook answers; the pre-transfer hook lets a connection read only its own reply; the
// post-transfer hook removes both. Entries of connections that never finished are removed by
// later early hooks once they are older than any command may take.
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <sstream>
#include <string>

#include "rsync/command_reply.h"
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

bool WriteNew(const std::string& path, const std::string& content) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600);
    if (fd < 0) {
        return false;
    }
    size_t done = 0;
    bool ok = true;
    while (ok && done < content.size()) {
        ssize_t n = write(fd, content.data() + done, content.size() - done);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        ok = n > 0;
        if (ok) {
            done += static_cast<size_t>(n);
        }
    }
    return close(fd) == 0 && ok;
}

std::string TokenOf(const std::string& conn) {
    std::ifstream in(Spool() + "/conns/" + conn);
    std::string token;
    std::getline(in, token);
    return command_reply::ValidToken(token) ? token : std::string();
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
            command_reply::RemoveTree(path);
        }
    }
    closedir(d);
}

}  // namespace

int ReceiverHookEarly(int in_fd, bool oldServer) {
    const std::string spool = Spool();
    RemoveStale(spool + "/replies");
    RemoveStale(spool + "/conns");

    // rsync hands over at most about 5 KiB; anything beyond the command file limit is refused by
    // the parser, so reading stops a little past it.
    std::string input;
    char buffer[4096];
    while (input.size() <= command_reply::kMaxCommandFile) {
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
    ReceiverAnswer answer = ReceiverRunCommand(input, oldServer);
    if (answer.token.empty() || conn.empty()) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] receiver_hooks.cpp(%d): command without reply token refused\n",
                       __LINE__);
        return 1;
    }
    const std::string dir = spool + "/replies/" + answer.token;
    // An existing directory means a replayed or colliding token: never answer into it.
    if (mkdir(dir.c_str(), 0700) != 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] receiver_hooks.cpp(%d): cannot create reply: %s\n",
                       __LINE__, strerror(errno));
        return 1;
    }
    bool ok = true;
    if (answer.hasOutput) {
        ok = answer.output.size() <= command_reply::kMaxOutput &&
             WriteNew(dir + "/" + command_reply::kOutputFile, answer.output);
    }
    ok = ok &&
         WriteNew(dir + "/" + command_reply::kResultFile, std::to_string(answer.result) + "\n");
    ok = ok && WriteNew(spool + "/conns/" + conn, answer.token + "\n");
    if (!ok) {
        command_reply::RemoveTree(dir);
        Logger::LogMsg(Logger::Error, "[ERROR] receiver_hooks.cpp(%d): cannot write reply\n",
                       __LINE__);
        return 1;
    }
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

int ReceiverHookPost() {
    std::string conn = ConnectionId();
    if (conn.empty()) {
        return 1;
    }
    std::string token = TokenOf(conn);
    if (!token.empty()) {
        command_reply::RemoveTree(Spool() + "/replies/" + token);
    }
    unlink((Spool() + "/conns/" + conn).c_str());
    return 0;
}

}  // namespace S2S
