// Channel: the byte transport of the library. A stream socket (TCP over IPv4 or a local domain
// socket) held in non-blocking mode, with a read ring and a write ring of one fixed capacity,
// every wait bounded (one interval, 1 second by default), an inactivity timeout and an external
// abort flag. The channel waits with poll (PollFd); WaitFd keeps the select() form. An open
// channel can be turned into a TLS channel in place: the set of I/O operations is exchanged
// (SwitchChannelOp) and all buffering, timeouts and status codes stay as they are.
//
// Every operation returns a status of s2s_status.h: 0 or a negative code (-1 abort flag, -2 I/O
// failure / closed / peer gone, -3 system call failure, -4 invalid argument, -9 timeout).
//
// A channel is used by one thread at a time. The abort flag is the only cross-thread input: any
// thread (or a signal handler) may set the int it points to; each wait checks it before every
// poll, so an abort takes effect within one wait interval.
#ifndef S2S_CHANNEL_H
#define S2S_CHANNEL_H

#include <sys/select.h>
#include <sys/time.h>

#include <cstring>
#include <memory>
#include <string>

#include "s2s_export.h"

// The TLS layer works on OpenSSL's session and context objects; the header only needs their
// names (these are the library's own typedefs, repeated identically).
typedef struct ssl_st SSL;
typedef struct ssl_ctx_st SSL_CTX;

namespace S2S {

class S2S_EXPORT Channel {
  public:
    // The operation set: the handle is an int* holding the descriptor for a plain channel and the
    // SSL* session for a TLS one. Reads and writes return the byte count or a negative status.
    typedef int (*ReadOp)(void* handle, void* buf, unsigned int len, const timeval& wait,
                          int* flag);
    typedef int (*WriteOp)(void* handle, const void* buf, unsigned int len, const timeval& wait,
                           int* flag);
    typedef int (*GetFdOp)(const void* handle);
    typedef void (*CloseOp)(void* handle);
    typedef bool (*IsClosedOp)(const void* handle);

    // Mode values of SwitchChannelOp: 1 installs the plain set, any other value the TLS set.
    enum { kPlainOps = 1, kSSLOps = 0 };

    // Allocates both rings of `capacity` bytes; `capacity` is also the largest single Write.
    explicit Channel(unsigned int capacity);
    Channel(const Channel&) = delete;
    Channel& operator=(const Channel&) = delete;

    // Closes (flushing what is buffered first, non-virtually) and frees both rings.
    virtual ~Channel();

    // Connects to a local domain stream socket, blocking during the connect.
    virtual int Open(const char* path);
    // Adopts a connected socket (the accepting side). With `configure`: linger 1 s and
    // non-blocking. The descriptor is not closed on failure: the caller still owns it then.
    virtual int Open(int fd, bool configure);
    // TCP client to a dotted IPv4 address. A null `ip` or a negative `port` returns 0 at once
    // without opening anything: callers rely on that silent success.
    virtual int Open(const char* ip, int port);
    // Flushes, closes the handle and returns to the closed, plain state. Harmless when closed.
    virtual void Close();
    virtual void SetTimeout(unsigned int seconds);
    // REQUIRES: *flag outlives every use of the channel; null means no abort flag.
    virtual void SetFlag(int* flag);
    // Part of the TLS layer (net/channel_tls.cpp): 0, -2 (setup, binding, handshake) or -24
    // (peer not verified while untrusted peers are refused). The channel must be open.
    virtual int ConvertToSSLChannel(bool server);

    // Integers travel most significant byte first whatever the host's byte order. On a failure
    // the output is left untouched.
    virtual int ReadByte(unsigned char* value);
    virtual int ReadInt16(unsigned short* value);
    virtual int ReadInt32(unsigned int* value);
    virtual int ReadInt64(unsigned long long* value);
    virtual int WriteByte(unsigned char value);
    virtual int WriteInt16(unsigned short value);
    virtual int WriteInt32(unsigned int value);
    virtual int WriteInt64(unsigned long long value);

    // Delivers exactly `len` bytes or fails.
    virtual int Read(char* dst, unsigned int len);
    // As above; `count` is the number of bytes delivered. After a failure the partial bytes are
    // in `dst` and also remain in the read buffer.
    virtual int Read(char* dst, unsigned int len, unsigned int& count);
    // Buffers `len` bytes (at most `capacity`), flushing only when the ring would overflow.
    virtual int Write(const char* src, unsigned int len);
    virtual void ClearRead();
    virtual void ClearWrite();
    // Sends at least `want` buffered bytes (0: everything buffered now).
    virtual int FlushWrite(int want);
    // Dotted IPv4 address and port of the peer; 0 with an empty address on a closed channel.
    virtual int GetPeerInfo(std::string& ip, int& port) const;
    virtual bool IsClosed() const;
    // Receives until at least `want` more bytes are buffered.
    // REQUIRES: the read buffer is not full (callers call it on an empty buffer).
    virtual int ReadMore(int want);

    // Byte order reversal, independent of the host's byte order.
    virtual unsigned long long Convert(unsigned long long value);
    virtual unsigned int Convert(unsigned int value);
    virtual unsigned short Convert(unsigned short value);

    virtual int CreateSock();
    virtual int SetLinger(int fd, int seconds);
    virtual int SetNonBlock(int fd);
    virtual int ConnectWithTimeout(int fd, const char* ip, int port);
    // Installs the plain (mode 1) or the TLS (any other mode) operation set. Touches neither the
    // handle nor the buffers: the caller replaces the handle at the same time.
    virtual void SwitchChannelOp(int mode);

    void SetAllowUntrust(bool allow) { allow_untrust_ = allow; }
    bool IsAllowingUntrust() const { return allow_untrust_; }
    void SetSSLHostname(const std::string& name) { ssl_hostname_ = name; }
    // The ring size: the largest single Write. Writers of longer data split it.
    unsigned int GetCapacity() const { return capacity_; }

    // One bounded wait and at most one recv/send on the descriptor held by `handle`.
    static int ReadFd(int* handle, void* buf, unsigned int len, const timeval& wait, int* flag);
    static int WriteFd(int* handle, const void* buf, unsigned int len, const timeval& wait,
                       int* flag);

    // --- TLS layer (net/channel_tls.cpp) ---
    static int SSLReadFd(SSL* ssl, void* buf, unsigned int len, const timeval& wait, int* flag);
    static int SSLWriteFd(SSL* ssl, const void* buf, unsigned int len, const timeval& wait,
                          int* flag);
    // Ignores the abort flag on purpose: only `timeout` (of quiet `wait` intervals) ends a silent
    // handshake. `flag` is accepted for symmetry with the read and write operations.
    static int SSLHandshake(SSL* ssl, timeval wait, unsigned int timeout, int* flag);
    // The close and closed-test operations of the TLS set.
    static void SSLClose(SSL* ssl);
    static bool SSLIsClosed(const SSL* ssl);
    static int InitSSL(SSL*& ssl, SSL_CTX*& ctx, bool server, bool allow_untrusted);
    static void DeinitSSL(SSL*& ssl, SSL_CTX*& ctx, bool quiet);
    static int InstallVerifyCA(SSL_CTX* ctx);
    static int InstallPriKey(SSL_CTX* ctx);
    static int InstallCERT(SSL_CTX* ctx);
    // Process-wide file paths, read at each conversion; setters are meant for start-up.
    static const std::string& GetCAPath();
    static const std::string& GetKeyPath();
    static const std::string& GetCertPath();
    static void SetVerifyCAPath(const std::string& path);
    static void SetPriKeyPath(std::string path);
    static void SetCERTPath(std::string path);
    // Drains OpenSSL's error queue into the log.
    static void log_ssl();

  private:
    friend class PStream;
    // The message codec's shortcut to the rings, taken only when no step of the class is
    // replaced and no debug line is due (the codec checks both): the same bytes move as through
    // Read and Write. False when the bytes are not buffered (or the room is not free) in one
    // piece, or the channel is closed; the codec then goes the long way.
    bool ReadBuffered(char* dst, unsigned int len) {
        const char* at = BufferedRun(len);
        if (at == nullptr) {
            return false;
        }
        std::memcpy(dst, at, len);
        Consume(len);
        return true;
    }
    // The next `len` unconsumed bytes when they lie in one piece of the ring, else null. The
    // codec reads them in place and then consumes them.
    const char* BufferedRun(unsigned int len) const {
        if (handle_ == nullptr || len > r_size_ || len > capacity_ - r_head_) {
            return nullptr;
        }
        return r_buf_.get() + r_head_;
    }
    // The unconsumed bytes that lie in one piece from the read position: their start and, in
    // `len`, their count (null and 0 when nothing is buffered or the channel is closed).
    // A head left at the ring's end (the unconsumed bytes start at index 0) also gives null: the
    // long way reads them.
    const char* BufferedSpan(unsigned int& len) const {
        len = r_size_ < capacity_ - r_head_ ? r_size_ : capacity_ - r_head_;
        if (handle_ == nullptr || len == 0) {
            len = 0;
            return nullptr;
        }
        return r_buf_.get() + r_head_;
    }
    // REQUIRES: BufferedRun(len) or BufferedSpan gave at least `len` bytes.
    void Consume(unsigned int len) {
        r_size_ -= len;
        r_head_ = r_size_ == 0 ? 0 : r_head_ + len;
    }
    bool WriteBuffered(const char* src, unsigned int len) {
        char* at = WriteRoom(len);
        if (at == nullptr) {
            return false;
        }
        std::memcpy(at, src, len);
        Commit(len);
        return true;
    }
    // Where the next `len` bytes go when that much room is free in one piece of the ring, else
    // null. The codec writes them in place and then commits them.
    char* WriteRoom(unsigned int len) {
        if (handle_ == nullptr) {
            return nullptr;
        }
        unsigned int end = w_head_ + w_size_;
        unsigned int tail = end < capacity_ ? end : end - capacity_;
        unsigned int room = end < capacity_ ? capacity_ - tail : w_head_ - tail;
        return len > room ? nullptr : w_buf_.get() + tail;
    }
    // The free room that lies in one piece at the write position: its start and, in `len`, its
    // size (null and 0 when the channel is closed).
    char* WriteSpan(unsigned int& len) {
        if (handle_ == nullptr) {
            len = 0;
            return nullptr;
        }
        unsigned int end = w_head_ + w_size_;
        unsigned int tail = end < capacity_ ? end : end - capacity_;
        len = end < capacity_ ? capacity_ - tail : w_head_ - tail;
        return w_buf_.get() + tail;
    }
    // REQUIRES: WriteRoom(len) or WriteSpan gave at least `len` bytes, and they are written.
    void Commit(unsigned int len) { w_size_ += len; }

  protected:
    // One bounded wait on `fd`: each given set is reset to hold only `fd` before every select.
    // 0 when select reported the descriptor (the caller inspects the sets), -9 when one wait
    // interval passed quietly, -3 on a select failure, -1 once *flag is non-zero.
    static int WaitFd(int fd, fd_set* read_set, fd_set* write_set, fd_set* except_set,
                      const timeval& wait, int* flag);
    // The wait the channel itself uses (reads, writes, connects, TLS handshakes and records):
    // WaitFd's statuses and messages, with `ready` and `exception` saying what the read (or,
    // with `for_write`, the write) set and the exception set would have held. It waits with
    // poll rather than select, and differs from WaitFd in these ways: a descriptor at or above
    // FD_SETSIZE, which select's sets cannot hold (WaitFd refuses it with -3), is waited on like
    // any other, so a busy service with many descriptors keeps working; a wait costs less (no
    // sets copied in and out, no time written back); the interval is rounded up to whole
    // milliseconds (and at most about 24 days); and a write wait on a socket whose peer hung up
    // returns at once as ready, so the send that follows reports the peer gone (-2, with the
    // SIGPIPE any send to a gone peer raises) without first sleeping out the interval.
    static int PollFd(int fd, bool for_write, const timeval& wait, int* flag, bool& ready,
                      bool& exception);

    // The operation set of the plain channel.
    static int PlainGetFd(const int* handle);
    static void PlainClose(int* handle);
    static bool PlainIsClosed(const int* handle);

    // ReadFd on a descriptor; `found_nothing` says whether its first, non-blocking receive found
    // nothing queued (false when it was not tried: a set abort flag or no descriptor).
    static int ReceiveFd(int fd, void* buf, unsigned int len, const timeval& wait, int* flag,
                         bool& found_nothing);
    // One receive of ReadMore on the plain operation set, trying first or waiting first as the
    // connection has taught it (see misses_in_row_).
    int ReceivePlain(char* at, unsigned int len);

    // The descriptor behind the handle (get-descriptor op); -1 when closed.
    int GetFd() const { return get_fd_op_(handle_); }

    // Null when closed. A plain handle is an int allocated by the channel (Open), released by
    // PlainClose or, when the session takes the descriptor over, by ConvertToSSLChannel.
    void* handle_ = nullptr;
    ReadOp read_op_ = nullptr;
    WriteOp write_op_ = nullptr;
    GetFdOp get_fd_op_ = nullptr;
    CloseOp close_op_ = nullptr;
    IsClosedOp is_closed_op_ = nullptr;

    // Ring of bytes written but not yet sent: w_head_ is the oldest unsent byte.
    std::unique_ptr<char[]> w_buf_;
    unsigned int w_head_ = 0;
    unsigned int w_size_ = 0;
    // Ring of received bytes not yet consumed. r_head_ may equal capacity_ right after a read
    // that ended exactly at the buffer end; it then behaves as 0.
    std::unique_ptr<char[]> r_buf_;
    unsigned int r_head_ = 0;
    unsigned int r_size_ = 0;
    unsigned int capacity_;

    timeval wait_ = {1, 0};
    unsigned int timeout_ = 60;  // seconds of inactivity; 0 waits forever
    int* flag_ = nullptr;
    bool is_ssl_ = false;
    bool allow_untrust_ = true;
    // How a plain channel receives, learnt from the connection itself. A receive tried before
    // any wait finds the bytes at once when the peer is ahead (a stream, or a peer that answers
    // before this side reads again) and is a wasted call when it is not (a request whose reply is
    // still on its way). So once kMissesToWait tries in a row have found nothing, the channel
    // waits first, and tries again after 1, then 3, 7 ... waits (at most kTryEveryMost - 1) while
    // the tries keep finding nothing. A try that finds bytes, or a receive that fills the room
    // offered, sends it back to trying first; so does a new connection (ClearRead).
    static constexpr unsigned int kMissesToWait = 3;
    static constexpr unsigned int kTryEveryMost = 64;
    unsigned int misses_in_row_ = 0;  // up to kMissesToWait
    unsigned int try_every_ = 1;      // receives per try once waiting first
    unsigned int waits_since_try_ = 0;
    std::string ssl_hostname_;
};

}  // namespace S2S

#endif  // S2S_CHANNEL_H
