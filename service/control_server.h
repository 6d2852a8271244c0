// ControlServer: the service's end of the control socket. One thread (the service's loop) polls
// the listener and every connection; a connection that has sent one whole request gets its reply
// and is closed. Nothing a client does blocks another: requests are read without blocking, with a
// size cap, a nesting cap and a time limit, and every refusal is answered with a status and a
// message while the server goes on.
#ifndef S2S_SERVICE_CONTROL_SERVER_H
#define S2S_SERVICE_CONTROL_SERVER_H

#include <poll.h>

#include <cstddef>
#include <functional>
#include <string>
#include <vector>

#include "s2s_ipc.h"
#include "s2s_pobject.h"

namespace s2sd {

struct ControlLimits {
    size_t max_request_bytes = 1 << 20;
    size_t max_depth = 16;
    long request_ms = 5000;  // a client has this long to send its whole request
    size_t max_clients = 256;
};

class ControlServer {
  public:
    using Handler = std::function<void(const S2S::PObject& request, S2S::PObject& reply)>;

    ControlServer(const ControlLimits& limits, Handler handler);
    ~ControlServer();
    ControlServer(const ControlServer&) = delete;
    ControlServer& operator=(const ControlServer&) = delete;

    // Listens at `path` (mode 0600, its directory 0700 created when missing). 0 or -1.
    int Listen(const std::string& path, std::string& error);
    void Close();
    // Appends the descriptors to poll; `Process` takes the same entries back after poll.
    void AddPollFds(std::vector<pollfd>& fds) const;
    void Process(const std::vector<pollfd>& fds, long now_ms);
    // Milliseconds until the next client's time limit (or -1 when none).
    long NextDeadline(long now_ms) const;
    size_t Clients() const { return clients_.size(); }

  private:
    struct Client {
        int fd = -1;
        std::string bytes;
        long deadline_ms = 0;
        bool draining = false;  // over the cap: reading and dropping until the client is quiet
        size_t drained = 0;
        long quiet_since_ms = 0;
    };
    void Accept(long now_ms);
    // Reads what is there; true when the client is finished with (answered or gone).
    bool Serve(Client& client, long now_ms);
    void Reply(Client& client, unsigned status, const std::string& message);
    void Reply(Client& client, const S2S::PObject& reply);

    ControlLimits limits_;
    Handler handler_;
    S2S::IPCListener listener_;
    std::string path_;
    std::vector<Client> clients_;
};

// Monotonic milliseconds.
long NowMs();

}  // namespace s2sd

#endif  // S2S_SERVICE_CONTROL_SERVER_H
