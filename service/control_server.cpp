// The control socket's connections (docs/service.md).
#include "service/control_server.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "s2s_control.h"
#include "s2s_logger.h"
#include "service/files.h"
#include "service/message.h"

namespace s2sd {

namespace {

// How long a client over the size cap may go on sending before it is answered anyway, and how
// long it must stay quiet to count as done sending.
constexpr long kDrainQuietMs = 200;
constexpr size_t kDrainMax = 1024u << 20;

// The serving side of one connection: the IPC sender whose channel gives up on a client that does
// not take its reply.
class ReplySender : public S2S::IPCSender {
  public:
    void SetTimeout(unsigned seconds) { channel_.SetTimeout(seconds); }
};

}  // namespace

long NowMs() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

ControlServer::ControlServer(const ControlLimits& limits, Handler handler)
    : limits_(limits), handler_(std::move(handler)) {}

ControlServer::~ControlServer() {
    Close();
}

int ControlServer::Listen(const std::string& path, std::string& error) {
    const std::string dir = path.substr(0, path.rfind('/'));
    if (!dir.empty() && MakeDirs(dir, 0700, error) != 0) {
        return -1;
    }
    // The socket file takes its mode at bind time: no moment in which others may connect.
    const mode_t old_mask = umask(077);
    const int rc = listener_.prepare(path);
    umask(old_mask);
    if (rc != 0) {
        error = "cannot listen on " + path;
        return -1;
    }
    chmod(path.c_str(), 0600);
    // Accepting drains the backlog until it would block, so the loop never waits in accept.
    const int flags = fcntl(listener_.getFD(), F_GETFL);
    if (flags < 0 || fcntl(listener_.getFD(), F_SETFL, flags | O_NONBLOCK) != 0) {
        error = "cannot make the control socket non-blocking";
        listener_.close();
        return -1;
    }
    path_ = path;
    return 0;
}

void ControlServer::Close() {
    for (Client& client : clients_) {
        close(client.fd);
    }
    clients_.clear();
    listener_.close();
}

void ControlServer::AddPollFds(std::vector<pollfd>& fds) const {
    if (listener_.getFD() >= 0) {
        fds.push_back({listener_.getFD(), POLLIN, 0});
    }
    for (const Client& client : clients_) {
        fds.push_back({client.fd, POLLIN, 0});
    }
}

long ControlServer::NextDeadline(long now_ms) const {
    long next = -1;
    for (const Client& client : clients_) {
        long at = client.deadline_ms;
        if (client.draining) {
            at = std::min(at, client.quiet_since_ms + kDrainQuietMs);
        }
        const long wait = std::max(0L, at - now_ms);
        next = next < 0 ? wait : std::min(next, wait);
    }
    return next;
}

void ControlServer::Accept(long now_ms) {
    for (;;) {
        const int fd = accept4(listener_.getFD(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
        if (fd < 0) {
            return;
        }
        Client client;
        client.fd = fd;
        client.deadline_ms = now_ms + limits_.request_ms;
        if (clients_.size() >= limits_.max_clients) {
            Reply(client, S2S::Control::kInternal, "too many clients at once; try again");
            continue;
        }
        clients_.push_back(client);
    }
}

void ControlServer::Process(const std::vector<pollfd>& fds, long now_ms) {
    bool listener_ready = false;
    for (const pollfd& p : fds) {
        if (p.fd == listener_.getFD() && (p.revents & POLLIN) != 0) {
            listener_ready = true;
        }
    }
    for (size_t i = 0; i < clients_.size();) {
        if (Serve(clients_[i], now_ms)) {
            clients_.erase(clients_.begin() + static_cast<long>(i));
        } else {
            ++i;
        }
    }
    if (listener_ready) {
        Accept(now_ms);
    }
}

bool ControlServer::Serve(Client& client, long now_ms) {
    char buffer[64 * 1024];
    bool gone = false;
    for (;;) {
        const ssize_t n = recv(client.fd, buffer, sizeof(buffer), 0);
        if (n > 0) {
            if (client.draining) {
                client.drained += static_cast<size_t>(n);
                client.quiet_since_ms = now_ms;
            } else {
                client.bytes.append(buffer, static_cast<size_t>(n));
                if (client.bytes.size() > limits_.max_request_bytes) {
                    client.draining = true;
                    client.drained = client.bytes.size();
                    client.quiet_since_ms = now_ms;
                    std::string().swap(client.bytes);
                }
            }
            if (client.draining && client.drained > kDrainMax) {
                break;
            }
            continue;
        }
        if (n == 0) {
            gone = true;
        } else if (errno == EINTR) {
            continue;
        } else if (errno != EAGAIN && errno != EWOULDBLOCK) {
            gone = true;
        }
        break;
    }
    const std::string limit = std::to_string(limits_.max_request_bytes);
    if (client.draining) {
        if (gone || client.drained > kDrainMax || now_ms - client.quiet_since_ms >= kDrainQuietMs ||
            now_ms >= client.deadline_ms) {
            S2S::Logger::LogMsg(S2S::Logger::Warning,
                                "[WARNING] control_server.cpp(%d): refused a request of more "
                                "than %s bytes\n",
                                __LINE__, limit.c_str());
            Reply(client, S2S::Control::kTooLarge,
                  "the request is larger than the limit of " + limit + " bytes");
            return true;
        }
        return false;
    }
    size_t length = 0;
    const Scan scan = ScanMessage(client.bytes, limits_.max_depth, length);
    if (scan == Scan::kIncomplete) {
        if (gone) {
            close(client.fd);
            return true;
        }
        if (now_ms >= client.deadline_ms) {
            Reply(client, S2S::Control::kBadRequest,
                  "no complete request within " + std::to_string(limits_.request_ms) + " ms");
            return true;
        }
        return false;
    }
    if (scan == Scan::kTooDeep) {
        Reply(client, S2S::Control::kTooLarge,
              "the request nests deeper than " + std::to_string(limits_.max_depth) + " levels");
        return true;
    }
    S2S::PObject request;
    if (scan == Scan::kMalformed || DecodeMessage(client.bytes, length, request) != 0) {
        Reply(client, S2S::Control::kBadRequest, "the request is not a well-formed value");
        return true;
    }
    S2S::PObject reply;
    handler_(request, reply);
    Reply(client, reply);
    return true;
}

void ControlServer::Reply(Client& client, unsigned status, const std::string& message) {
    S2S::PObject reply;
    reply[S2S::Control::kKeyStatus] = status;
    reply[S2S::Control::kKeyMessage] = message;
    Reply(client, reply);
}

void ControlServer::Reply(Client& client, const S2S::PObject& reply) {
    ReplySender sender;
    if (sender.assign(client.fd) != 0) {
        close(client.fd);
        client.fd = -1;
        return;
    }
    sender.SetTimeout(2);
    // A client that no longer reads loses its reply; the failure is in the log.
    sender.send(reply);
    sender.close();
    client.fd = -1;
}

}  // namespace s2sd
