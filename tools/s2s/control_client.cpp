// `s2s` asking the sync service: one request over the control socket, a reply or a message that
// says why there is none (service not running, no access to the socket), and the exit code a
// control status maps to.
#include "tools/s2s/control_client.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "s2s_control.h"
#include "s2s_control_client.h"
#include "s2s_platform.h"
#include "tools/s2s/commands.h"

namespace s2s_cli {

namespace {

namespace Control = S2S::Control;

struct StatusInfo {
    unsigned long long code;
    const char* name;
    ExitCode exit;
};

const StatusInfo kStatusTable[] = {
    {Control::kOk, "ok", kExitOK},
    {Control::kBadRequest, "bad-request", kExitService},
    {Control::kInvalidTask, "invalid-task", kExitInvalidTask},
    {Control::kNoSuchTask, "no-such-task", kExitNoSuchTask},
    {Control::kBusy, "busy", kExitBusy},
    {Control::kNotRunning, "not-running", kExitNotRunning},
    {Control::kInternal, "internal", kExitService},
    {Control::kTooLarge, "too-large", kExitService},
};

std::string SocketPath() {
    return S2SPath(Control::kSocketPath);
}

// Why no reply came: the socket's absence and a refused connection mean the service is not
// running; anything else means it is there and the exchange failed.
int ExplainNoReply(const std::string& path, const std::string& error) {
    const std::string start = "; start it with 'systemctl start s2sd' or 's2sd --daemon'";
    struct stat st;
    if (stat(path.c_str(), &st) != 0) {
        if (errno == ENOENT || errno == ENOTDIR) {
            return Fail(kExitNoService, "the sync service s2sd is not running (no control socket " +
                                            path + ")" + start);
        }
        return Fail(kExitService, "cannot reach the control socket " + path + ": " +
                                      std::strerror(errno) + " (s2sd answers root only)");
    }
    if (!S_ISSOCK(st.st_mode)) {
        return Fail(kExitNoService,
                    "the sync service s2sd is not running (" + path + " is not a socket)" + start);
    }
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    int err = 0;
    if (fd >= 0) {
        sockaddr_un addr = {};
        addr.sun_family = AF_UNIX;
        std::strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
        if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
            err = errno;
        }
        close(fd);
    }
    if (err == ECONNREFUSED || err == ENOENT) {
        return Fail(kExitNoService, "the sync service s2sd is not running (" + path +
                                        " refuses connections)" + start);
    }
    if (err == EACCES || err == EPERM) {
        return Fail(kExitService,
                    "permission denied on the control socket " + path + ": s2sd answers root only");
    }
    return Fail(kExitService, "s2sd did not answer: " + error);
}

}  // namespace

int ControlRequest(const S2S::PObject& request, S2S::PObject& reply, std::string& error) {
    return S2S::Control::Request(request, reply, error);
}

ExitCode ExitForControlStatus(unsigned long long status) {
    for (const StatusInfo& info : kStatusTable) {
        if (info.code == status) {
            return info.exit;
        }
    }
    return kExitService;
}

std::string ControlStatusName(unsigned long long status) {
    for (const StatusInfo& info : kStatusTable) {
        if (info.code == status) {
            return std::string(info.name) + " (" + std::to_string(status) + ")";
        }
    }
    return "status " + std::to_string(status);
}

int AskService(const S2S::PObject& request, S2S::PObject& reply) {
    std::string error;
    reply = S2S::PObject();
    if (ControlRequest(request, reply, error) != 0) {
        return ExplainNoReply(SocketPath(), error);
    }
    const S2S::PObject& answer = reply;
    if (!answer.isMap() || !answer[Control::kKeyStatus].isInteger()) {
        return Fail(kExitService, "s2sd sent a reply without a status");
    }
    const unsigned long long status = answer[Control::kKeyStatus].asUInt64();
    if (status == Control::kOk) {
        return kExitOK;
    }
    const std::string message = answer[Control::kKeyMessage].asString();
    return Fail(ExitForControlStatus(status),
                "s2sd: " + ControlStatusName(status) + (message.empty() ? "" : ": " + message));
}

}  // namespace s2s_cli
