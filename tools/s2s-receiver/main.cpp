// s2s-receiver: sets up and serves the receiving end of the sync over the stock rsync daemon.
// Administration subcommands for people; hook subcommands for the daemon's command module.
#include <limits.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <iostream>
#include <string>
#include <vector>

#include "s2s_logger.h"
#include "s2s_receiver.h"
#include "s2s_rsync_wrapper.h"

namespace {

const char kUsage[] =
    "usage: s2s-receiver configure --user NAME [--port N] [--address ADDR]\n"
    "                              [--max-connections N] [--old-server]\n"
    "           (the password is read from the first line of standard input)\n"
    "       s2s-receiver start | stop | status\n"
    "       s2s-receiver --help\n"
    "       s2s-receiver hook-early [--old-server] | hook-key   (run by the daemon)\n"
    "       s2s-receiver hook-pre | hook-post   (daemon configurations of earlier versions)\n";

int Usage() {
    std::fputs(kUsage, stderr);
    return 2;
}

std::string When(long seconds) {
    char text[32];
    time_t t = static_cast<time_t>(seconds);
    struct tm local;
    if (localtime_r(&t, &local) == nullptr ||
        std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S", &local) == 0) {
        return std::to_string(seconds);
    }
    return text;
}

// How the last sync of a share went, as far as the receiver saw it.
std::string LastSync(const S2S::ReceiverShareState& s) {
    if (s.lastStart > s.lastTime) {
        return "started " + When(s.lastStart) + ", not finished";
    }
    if (s.lastResult == "complete") {
        return "completed " + When(s.lastTime);
    }
    if (s.lastResult == "abort") {
        return "failed " + When(s.lastTime);
    }
    if (s.lastResult == "unpair") {
        return "released " + When(s.lastTime);
    }
    return "none recorded";
}

bool ParsePort(const char* text, int* port) {
    char* end = nullptr;
    long value = std::strtol(text, &end, 10);
    if (end == text || *end != '\0' || value <= 0 || value > 65535) {
        return false;
    }
    *port = static_cast<int>(value);
    return true;
}

std::string SelfPath() {
    char buf[PATH_MAX];
    ssize_t n = readlink("/proc/self/exe", buf, sizeof buf - 1);
    if (n <= 0) {
        return std::string();
    }
    buf[n] = '\0';
    return buf;
}

int Configure(int argc, char** argv) {
    S2S::ReceiverSettings s;
    for (int i = 2; i < argc; ++i) {
        std::string a = argv[i];
        if (a == "--old-server") {
            s.oldServer = true;
        } else if (a == "--port" && i + 1 < argc) {
            if (!ParsePort(argv[++i], &s.port)) {
                return Usage();
            }
        } else if (a == "--address" && i + 1 < argc) {
            s.address = argv[++i];
        } else if (a == "--user" && i + 1 < argc) {
            s.user = argv[++i];
        } else if (a == "--max-connections" && i + 1 < argc) {
            if (!ParsePort(argv[++i], &s.maxConnections)) {
                return Usage();
            }
        } else {
            return Usage();
        }
    }
    if (s.user.empty()) {
        return Usage();
    }
    // Never from the command line: other users can read a process's arguments.
    if (!std::getline(std::cin, s.password)) {
        std::fputs("s2s-receiver: no password on standard input\n", stderr);
        return 1;
    }
    // A password file written on another system may end its line with CR LF: the sender drops
    // that one CR as well, so both ends read the same password from the same file.
    if (!s.password.empty() && s.password.back() == '\r') {
        s.password.pop_back();
    }
    if (!VURN::Backup::RsyncWrapper::credentialsFit(s.user, s.password)) {
        std::fprintf(stderr,
                     "s2s-receiver: the password is too long: rsync cannot authenticate user name "
                     "and password of more than %zu bytes together (with the ':' between them)\n",
                     VURN::Backup::RsyncWrapper::kMaxSecretLine);
        return 1;
    }
    s.handlerPath = SelfPath();
    std::string error;
    std::vector<std::string> notes;
    int rc = S2S::ReceiverConfigure(s, &error, &notes);
    for (const auto& note : notes) {
        std::fprintf(stderr, "s2s-receiver: %s\n", note.c_str());
    }
    if (rc != 0) {
        std::fprintf(stderr, "s2s-receiver: %s\n", error.c_str());
        return 1;
    }
    return 0;
}

int Status() {
    S2S::ReceiverStatus st;
    int rc = S2S::ReceiverGetStatus(&st);
    std::printf("service: %s\n", st.running ? "running" : "stopped");
    if (st.transfers == 0) {
        std::printf("transfers: none running\n");
    } else {
        std::printf("transfers: %d running\n", st.transfers);
    }
    if (rc != 0) {
        std::fflush(stdout);
        std::fprintf(stderr, "s2s-receiver: %s\n", st.storeError.c_str());
        return 1;
    }
    if (st.pairedClientID == "S2SMULTI-SRC-SUPPORT") {
        std::printf("pairing: multi-client\n");
    } else if (!st.pairedClientID.empty()) {
        std::printf("pairing: single-client %s %s\n", st.pairedClientID.c_str(),
                    st.pairedServerName.c_str());
    }
    for (const auto& c : st.clients) {
        std::printf("client: %s %s\n", c.clientID.c_str(), c.serverName.c_str());
    }
    for (const auto& s : st.shares) {
        std::string binding = s.owner.empty() ? "free" : "bound to " + s.owner;
        std::printf("share: %s %s, last sync %s\n", s.name.c_str(), binding.c_str(),
                    LastSync(s).c_str());
    }
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc < 2) {
        return Usage();
    }
    std::string cmd = argv[1];
    if (cmd == "--help" || cmd == "-h" || cmd == "help") {
        std::fputs(kUsage, stdout);
        return 0;
    }
    // The library's log lines go to syslog: hooks have no terminal (their standard streams go to
    // the daemon or, for a refusing pre-transfer hook, to the client), and a person at the
    // terminal gets each failure once, in plain words, from this program.
    S2S::Logger::Initialize(S2S::Logger::Syslog, S2S::Logger::Warning, "", 0);
    std::string error;
    if (cmd == "configure") {
        return Configure(argc, argv);
    }
    if (cmd == "start" && argc == 2) {
        if (S2S::ReceiverStart(&error) != 0) {
            std::fprintf(stderr, "s2s-receiver: %s\n", error.c_str());
            return 1;
        }
        return 0;
    }
    if (cmd == "stop" && argc == 2) {
        int rc = S2S::ReceiverStop(&error);
        if (rc != 0) {
            // 1: stopped, but the pairing store could not record it; the daemon is down.
            std::fprintf(stderr, "s2s-receiver: %s%s\n", rc > 0 ? "warning: " : "", error.c_str());
        }
        return rc < 0 ? 1 : 0;
    }
    if (cmd == "status" && argc == 2) {
        return Status();
    }
    if (cmd == "hook-early" &&
        (argc == 2 || (argc == 3 && std::strcmp(argv[2], "--old-server") == 0))) {
        return S2S::ReceiverHookEarly(0, argc == 3);
    }
    if (cmd == "hook-pre" && argc == 2) {
        return S2S::ReceiverHookPre();
    }
    if (cmd == "hook-key" && argc == 2) {
        return S2S::ReceiverHookKey();
    }
    if (cmd == "hook-post" && argc == 2) {
        return S2S::ReceiverHookPost();
    }
    return Usage();
}
