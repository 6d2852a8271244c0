// Local messaging between the sync service's programs on one machine. IPCListener is the serving
// end: a listening socket, TCP on 127.0.0.1 (port found by probing upward) or a domain socket at a
// path. IPCSender is a connection end that exchanges whole PObject values, one message per value;
// the serving side accepts a descriptor and wraps it with assign(), so both ends use IPCSender.
//
// Results are 0 (or a port / descriptor where stated) and -1 for any failure; the cause is in the
// log. Nothing here locks: each object is used by one thread at a time.
//
// A sender keeps one PStream for all the messages of a connection instead of building one per
// message: a stream is clean again after every Send and Recv (key path, depth and counters
// cleared, the byte count restarted), so no message sees another's state, and the buffers of its
// key path are allocated once instead of per message. close() replaces the stream, so what a
// connection's messages made it hold goes with the connection.
#ifndef S2S_IPC_H
#define S2S_IPC_H

#include <sys/time.h>

#include <optional>
#include <string>

#include "s2s_channel.h"
#include "s2s_export.h"
#include "s2s_pobject.h"
#include "s2s_stream.h"

namespace S2S {

class S2S_EXPORT IPCListener {
  public:
    IPCListener();
    ~IPCListener();
    IPCListener(const IPCListener&) = delete;
    IPCListener& operator=(const IPCListener&) = delete;

    // Bound of the wait in isReady() (3 seconds at first).
    void setTimeout(timeval timeout);
    int getFD() const { return fd_; }

    // TCP listener on 127.0.0.1 at `port` or the first free port above it; replaces a listener
    // already held (closed as close() does). Returns the port listened on, or -1. Port 0 lets the
    // system choose.
    int prepare(int port);
    // Domain-socket listener at `path` (a stale socket file there is removed first). Refuses with
    // -1 while a listener is held. 0 or -1.
    int prepare(const std::string& path);
    // True when a connection is waiting; waits at most the timeout. False without a listener.
    bool isReady();
    // The accepted descriptor (hand it to IPCSender::assign) or -1.
    int accept();
    // Closes the listener; a domain listener also removes its socket file.
    void close();

    // Binds `fd` to 127.0.0.1 at `port` or, when that fails, the next port up; the port or -1.
    static int do_bind(int fd, int port);
    // A listening TCP socket on 127.0.0.1 at exactly `port`; the descriptor or -1.
    static int OpenSocket(int port);
    static int OpenDomainSocket(const std::string& path);
    static int CloseSocket(int fd);
    static int CloseDomainSocket(int fd);

  private:
    timeval timeout_;
    int fd_;
    std::string domain_path_;
};

class S2S_EXPORT IPCSender {
  public:
    // The buffer capacity of a sender's channel, so also its largest single channel write.
    static constexpr unsigned int kCapacity = 0x14000;

    IPCSender();
    virtual ~IPCSender();
    IPCSender(const IPCSender&) = delete;
    IPCSender& operator=(const IPCSender&) = delete;

    // A message exchange can be changed by a subclass; the request/reply form calls recv()
    // through the virtual table.
    virtual int send(const PObject& obj, bool wait_reply, PObject& reply);
    virtual int send(const PObject& obj);
    virtual int recv(PObject& obj);

    int connect(int port);                 // TCP to 127.0.0.1:port
    int connect(const std::string& path);  // domain socket
    // An accepted descriptor: owned by the sender after 0, still the caller's after -1.
    int assign(int fd);
    void close();  // flushes what is buffered, then closes
    // What recv() accepts from the peer (PStream::SetRecvLimits; the stream's defaults at first).
    void SetRecvLimits(size_t max_bytes, unsigned int max_depth) {
        max_recv_bytes_ = max_bytes;
        max_recv_depth_ = max_depth;
    }

  protected:
    Channel channel_;

  private:
    // Always engaged; re-created by close().
    std::optional<PStream> stream_;
    size_t max_recv_bytes_ = PStream::kDefaultMaxRecvBytes;
    unsigned int max_recv_depth_ = PStream::kDefaultMaxRecvDepth;
};

}  // namespace S2S

#endif  // S2S_IPC_H
