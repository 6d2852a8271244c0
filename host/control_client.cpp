// The control socket's client: connect, one request, one reply, close.
#include "s2s_control_client.h"

#include <sys/stat.h>

#include "s2s_control.h"
#include "s2s_ipc.h"
#include "s2s_platform.h"

namespace S2S {
namespace Control {

namespace {

// A sender whose channel gives up after a bounded silence (the channel's own default is a
// minute, too long for a person waiting at a prompt or a status display polling every second).
class BoundedSender : public IPCSender {
  public:
    explicit BoundedSender(unsigned seconds) { channel_.SetTimeout(seconds); }
};

}  // namespace

int Request(const PObject& request, PObject& reply, std::string& error, unsigned timeout_seconds) {
    const char* path = S2SPath(kSocketPath);
    if (path == nullptr) {
        error = "out of memory";
        return -1;
    }
    struct stat st;
    if (stat(path, &st) != 0) {
        error = std::string("the sync service s2sd is not running (no socket at ") + path + ")";
        return -1;
    }
    // 0 would make the channel wait forever.
    BoundedSender sender(timeout_seconds == 0 ? 1 : timeout_seconds);
    if (sender.connect(std::string(path)) != 0) {
        error = std::string("the sync service s2sd is not running or refused the connection (") +
                path + ")";
        return -1;
    }
    PObject answer;
    if (sender.send(request, true, answer) != 0) {
        error = "the sync service s2sd did not answer the request (waited at most " +
                std::to_string(timeout_seconds == 0 ? 1 : timeout_seconds) + " s)";
        return -1;
    }
    if (!answer.isMap() || !answer[kKeyStatus].isInteger()) {
        error = "the sync service s2sd sent a reply without a status";
        return -1;
    }
    reply.swap(answer);
    return 0;
}

}  // namespace Control
}  // namespace S2S
