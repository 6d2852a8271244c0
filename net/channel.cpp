// Channel: the plain socket operations, the read and write rings, and the waits. Every wait is a
// poll of at most one interval (one second), so the abort flag is looked at at least once a second
// and the inactivity timeout counts whole quiet seconds; the rings are allocated once, in the
// constructor, and the data path never allocates.
#include "s2s_channel.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <openssl/ssl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <ctime>
#include <new>

#include "core/copy_bytes.h"
#include "net/log_debug.h"
#include "s2s_logger.h"
#include "s2s_status.h"

namespace S2S {

namespace {

// The address length every domain-socket peer of the service uses: the whole sockaddr_un.
constexpr socklen_t kDomainAddrLen = 110;
constexpr size_t kDomainPathMax = 107;

// The flag is a plain int owned by the caller and set from another thread or a signal handler;
// an atomic load keeps each check a fresh, well-defined read.
bool AbortRequested(const int* flag) {
    return flag != nullptr && __atomic_load_n(flag, __ATOMIC_RELAXED) != 0;
}

// A wait that failed with `err`: logged as a failed select, -3.
int WaitFailure(int err) {
    Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): select: %s (%d)\n", __LINE__,
                   std::strerror(err), err);
    return kStatusSystemError;
}

// The end of a wait call that reported nothing ready (`ret` <= 0): -9 after a quiet interval,
// -3 on a failure, 0 when a signal interrupted it (the caller waits again).
int NothingReady(int ret) {
    if (ret == 0) {
        S2S_LOG_DEBUG("[DEBUG] s2s_channel.cpp(%d): select: timeout\n", __LINE__);
        return kStatusConnectionTimeout;
    }
    return errno == EINTR ? 0 : WaitFailure(errno);
}

// The plain set's read operation, named so that ReadMore can tell when it is the one installed.
int PlainReadOp(void* handle, void* buf, unsigned int len, const timeval& wait, int* flag) {
    return Channel::ReadFd(static_cast<int*>(handle), buf, len, wait, flag);
}

}  // namespace

Channel::Channel(unsigned int capacity)
    // Both rings are allocated once here and never again: the data path does not allocate.
    : w_buf_(new char[capacity]), r_buf_(new char[capacity]), capacity_(capacity) {
    SwitchChannelOp(kPlainOps);
}

Channel::~Channel() {
    Channel::Close();
}

int Channel::Open(const char* path) {
    if (path == nullptr) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): Channel: Can not connect to server at "
                       "'%s'. %s\n",
                       __LINE__, "(null)", std::strerror(EINVAL));
        return kStatusInvalidArgument;
    }
    // Opening over an open channel replaces the old connection; it must not leak.
    if (!IsClosed()) {
        Close();
    }
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): Channel: Can not open socket. %s\n",
                       __LINE__, std::strerror(errno));
        return kStatusSystemError;
    }
    sockaddr_un addr;
    std::memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, path, kDomainPathMax);
    if (::connect(fd, reinterpret_cast<sockaddr*>(&addr), kDomainAddrLen) != 0) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): Channel: Can not connect to server at "
                       "'%s'. %s\n",
                       __LINE__, path, std::strerror(errno));
        ::close(fd);
        return kStatusIOError;
    }
    if (SetNonBlock(fd) < 0) {
        ::close(fd);
        return kStatusSystemError;
    }
    // The plain handle is a heap-held descriptor so that one opaque pointer can hold either it or
    // a TLS session; PlainClose deletes it.
    int* handle = new (std::nothrow) int(fd);
    if (handle == nullptr) {
        ::close(fd);
        return kStatusSystemError;
    }
    handle_ = handle;
    ClearRead();
    ClearWrite();
    return kStatusSuccessful;
}

int Channel::Open(int fd, bool configure) {
    if (!IsClosed()) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): Open: Channel already opened [%d]\n",
                       __LINE__, GetFd());
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): Open: %s\n", __LINE__,
                       std::strerror(EINVAL));
        return kStatusInvalidArgument;
    }
    if (configure) {
        if (SetLinger(fd, 1) < 0) {
            Logger::LogMsg(
                Logger::Warning,
                "[WARNING] s2s_channel.cpp(%d): Open: SetLinger to socket [%d] failed, %s\n",
                __LINE__, fd, std::strerror(errno));
            return kStatusSystemError;
        }
        if (SetNonBlock(fd) < 0) {
            Logger::LogMsg(
                Logger::Warning,
                "[WARNING] s2s_channel.cpp(%d): Open: SetNonBlock to socket [%d] failed, %s\n",
                __LINE__, fd, std::strerror(errno));
            return kStatusSystemError;
        }
    }
    if (fd == -1) {
        return kStatusInvalidArgument;
    }
    int* handle = new (std::nothrow) int(fd);  // see Open(const char*)
    if (handle == nullptr) {
        return kStatusSystemError;
    }
    handle_ = handle;
    ClearRead();
    ClearWrite();
    S2S_LOG_DEBUG("[DEBUG] s2s_channel.cpp(%d): Channel: opening socket %d\n", __LINE__, fd);
    return kStatusSuccessful;
}

int Channel::Open(const char* ip, int port) {
    if (ip == nullptr || port < 0) {
        return kStatusSuccessful;  // deliberately a silent success: callers rely on it
    }
    if (!IsClosed()) {
        Close();
    }
    int fd = CreateSock();
    if (fd == -1) {
        return kStatusIOError;
    }
    if (SetLinger(fd, 1) < 0 || SetNonBlock(fd) < 0) {
        ::close(fd);
        return kStatusSystemError;
    }
    if (ConnectWithTimeout(fd, ip, port) < 0) {
        ::close(fd);
        return kStatusIOError;
    }
    ClearRead();
    ClearWrite();
    int* handle = new (std::nothrow) int(fd);  // see Open(const char*)
    if (handle == nullptr) {
        ::close(fd);
        return kStatusSystemError;
    }
    handle_ = handle;
    return kStatusSuccessful;
}

void Channel::Close() {
    if (IsClosed()) {
        is_ssl_ = false;
        SwitchChannelOp(kPlainOps);
        return;
    }
    int ret = FlushWrite(0);
    if (ret < 0) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): FlushWrite: %s\n", __LINE__,
                       StatusMessage(ret));
        ClearRead();
        ClearWrite();
    }
    close_op_(handle_);
    handle_ = nullptr;
    is_ssl_ = false;
    SwitchChannelOp(kPlainOps);
}

void Channel::SetTimeout(unsigned int seconds) {
    timeout_ = seconds;
}

void Channel::SetFlag(int* flag) {
    flag_ = flag;
}

int Channel::ReadByte(unsigned char* value) {
    unsigned char byte;
    int ret = Read(reinterpret_cast<char*>(&byte), 1);
    if (ret == kStatusSuccessful) {
        *value = byte;
    }
    return ret;
}

int Channel::ReadInt16(unsigned short* value) {
    unsigned char b[2];
    int ret = Read(reinterpret_cast<char*>(b), sizeof(b));
    if (ret == kStatusSuccessful) {
        *value = static_cast<unsigned short>((b[0] << 8) | b[1]);
    }
    return ret;
}

int Channel::ReadInt32(unsigned int* value) {
    unsigned char b[4];
    int ret = Read(reinterpret_cast<char*>(b), sizeof(b));
    if (ret == kStatusSuccessful) {
        unsigned int v = 0;
        for (unsigned char byte : b) {
            v = (v << 8) | byte;
        }
        *value = v;
    }
    return ret;
}

int Channel::ReadInt64(unsigned long long* value) {
    unsigned char b[8];
    int ret = Read(reinterpret_cast<char*>(b), sizeof(b));
    if (ret == kStatusSuccessful) {
        unsigned long long v = 0;
        for (unsigned char byte : b) {
            v = (v << 8) | byte;
        }
        *value = v;
    }
    return ret;
}

int Channel::WriteByte(unsigned char value) {
    return Write(reinterpret_cast<const char*>(&value), 1);
}

int Channel::WriteInt16(unsigned short value) {
    const unsigned char b[2] = {static_cast<unsigned char>(value >> 8),
                                static_cast<unsigned char>(value)};
    return Write(reinterpret_cast<const char*>(b), sizeof(b));
}

int Channel::WriteInt32(unsigned int value) {
    unsigned char b[4];
    for (int i = 3; i >= 0; --i, value >>= 8) {
        b[i] = static_cast<unsigned char>(value);
    }
    return Write(reinterpret_cast<const char*>(b), sizeof(b));
}

int Channel::WriteInt64(unsigned long long value) {
    unsigned char b[8];
    for (int i = 7; i >= 0; --i, value >>= 8) {
        b[i] = static_cast<unsigned char>(value);
    }
    return Write(reinterpret_cast<const char*>(b), sizeof(b));
}

int Channel::Read(char* dst, unsigned int len) {
    unsigned int count = 0;
    return Read(dst, len, count);
}

int Channel::Read(char* dst, unsigned int len, unsigned int& count) {
    // The operation set answers directly: this runs once per tag and value on a message stream.
    if (is_closed_op_(handle_)) {
        return kStatusIOError;
    }
    // What is buffered first; a head equal to capacity_ reads as 0 (first piece empty).
    if (len <= r_size_ && len <= capacity_ - r_head_) {
        // The common case on a message stream: a tag, length or value already in one piece.
        CopyBytes(dst, r_buf_.get() + r_head_, len);
        r_size_ -= len;
        r_head_ = r_size_ == 0 ? 0 : r_head_ + len;
        count = len;
        S2S_LOG_DEBUG("[DEBUG] s2s_channel.cpp(%d): Read: read %d bytes, head = %d, size = %d\n",
                      __LINE__, count, r_head_, r_size_);
        return kStatusSuccessful;
    }
    unsigned int n = std::min(len, r_size_);
    if (n > 0) {
        unsigned int first = std::min(n, capacity_ - r_head_);
        CopyBytes(dst, r_buf_.get() + r_head_, first);
        if (n > first) {
            std::memcpy(dst + first, r_buf_.get(), n - first);
        }
        r_size_ -= n;
        if (r_size_ == 0) {
            r_head_ = 0;
        } else {
            r_head_ += n;
            if (r_head_ > capacity_) {
                r_head_ -= capacity_;
            }
        }
    }
    count = n;
    // Here the ring is empty with head 0 (or len is met), so each refill lands at index 0.
    while (count < len) {
        unsigned int chunk = std::min(len - count, capacity_);
        S2S_LOG_DEBUG(
            "[DEBUG] s2s_channel.cpp(%d): want = %d, len = %d, total = %d, capacity = "
            "%d\n",
            __LINE__, chunk, len, count, capacity_);
        int ret = ReadMore(static_cast<int>(chunk));
        if (ret != kStatusSuccessful) {
            // The partial bytes go to the caller and, on purpose, also stay buffered.
            std::memcpy(dst + count, r_buf_.get(), r_size_);
            count += r_size_;
            return ret;
        }
        std::memcpy(dst + count, r_buf_.get(), chunk);
        count += chunk;
        r_size_ -= chunk;
        r_head_ = r_size_ == 0 ? 0 : chunk;  // ReadMore may have read beyond the chunk
    }
    S2S_LOG_DEBUG("[DEBUG] s2s_channel.cpp(%d): Read: read %d bytes, head = %d, size = %d\n",
                  __LINE__, count, r_head_, r_size_);
    return kStatusSuccessful;
}

int Channel::Write(const char* src, unsigned int len) {
    if (is_closed_op_(handle_)) {  // see Read
        return kStatusIOError;
    }
    if (len > capacity_) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): Write: Exceed maximum data block size\n",
                       __LINE__);
        return kStatusInvalidArgument;
    }
    long long needed = static_cast<long long>(w_size_) + len - capacity_;
    if (needed > 0) {
        int ret = FlushWrite(static_cast<int>(needed));
        if (ret < 0) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): Write: FlushWrite failed\n", __LINE__);
            return ret;
        }
    }
    if (len > 0) {
        unsigned int tail = w_head_ + w_size_;
        if (tail <= capacity_) {
            unsigned int first = std::min(len, capacity_ - tail);
            CopyBytes(w_buf_.get() + tail, src, first);
            if (len > first) {
                std::memcpy(w_buf_.get(), src + first, len - first);
            }
        } else {
            CopyBytes(w_buf_.get() + (tail - capacity_), src, len);
        }
        w_size_ += len;
    }
    S2S_LOG_DEBUG("[DEBUG] s2s_channel.cpp(%d): Write: write %d bytes\n", __LINE__, len);
    return kStatusSuccessful;
}

void Channel::ClearRead() {
    r_head_ = 0;
    r_size_ = 0;
    misses_in_row_ = 0;  // a new connection (or none): nothing learnt about its receives yet
}

void Channel::ClearWrite() {
    w_head_ = 0;
    w_size_ = 0;
}

int Channel::FlushWrite(int want) {
    // A want beyond what is buffered could never be met; it means "everything".
    long long target = want == 0 ? w_size_ : std::min<long long>(want, w_size_);
    if (target > 0) {
        time_t last = std::time(nullptr);
        long long done = 0;
        while (done < target) {
            if (AbortRequested(flag_)) {
                return kStatusInterrupted;
            }
            unsigned int len = std::min(w_size_, capacity_ - w_head_);
            S2S_LOG_DEBUG("[DEBUG] s2s_channel.cpp(%d): WriteFd: from %d, len %d\n", __LINE__,
                          w_head_, len);
            int n = write_op_(handle_, w_buf_.get() + w_head_, len, wait_, flag_);
            if (n == kStatusConnectionTimeout) {
                // One quiet interval; the timeout counts from the last byte that moved.
                time_t now = std::time(nullptr);
                if (timeout_ != 0 && now - last >= static_cast<time_t>(timeout_)) {
                    Logger::LogMsg(Logger::Warning,
                                   "[WARNING] s2s_channel.cpp(%d): FlushWrite: Channel timeout "
                                   "for %u seconds\n",
                                   __LINE__, timeout_);
                    return kStatusConnectionTimeout;
                }
                continue;
            }
            if (n < 0) {
                return n;
            }
            done += n;
            last = std::time(nullptr);
            w_head_ += static_cast<unsigned int>(n);
            w_size_ -= static_cast<unsigned int>(n);
            if (w_head_ >= capacity_ || w_size_ == 0) {
                w_head_ = 0;
            }
        }
    }
    S2S_LOG_DEBUG("[DEBUG] s2s_channel.cpp(%d): FlushWrite: flush at least %d bytes\n", __LINE__,
                  want);
    return kStatusSuccessful;
}

int Channel::GetPeerInfo(std::string& ip, int& port) const {
    if (IsClosed()) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): GetPeerInfo: Attempting to get info of an "
                       "uninitialized channel\n",
                       __LINE__);
        ip.clear();
        port = 0;
        return kStatusSuccessful;
    }
    sockaddr_storage addr;
    std::memset(&addr, 0, sizeof(addr));
    socklen_t len = sizeof(addr);
    if (::getpeername(GetFd(), reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): GetPeerInfo: getpeername: %s\n", __LINE__,
                       std::strerror(errno));
        return kStatusSystemError;
    }
    char text[17];
    const sockaddr_in* in = reinterpret_cast<const sockaddr_in*>(&addr);
    // A domain-socket peer has no IPv4 address: inet_ntop refuses its family.
    if (::inet_ntop(addr.ss_family, &in->sin_addr, text, sizeof(text)) == nullptr) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): GetPeerInfo: inet_ntop: %s (%d)\n", __LINE__,
                       std::strerror(errno), errno);
        ip.clear();
        port = 0;
        return kStatusInterrupted;
    }
    ip = text;
    port = ntohs(in->sin_port);
    return kStatusSuccessful;
}

bool Channel::IsClosed() const {
    return is_closed_op_(handle_);
}

int Channel::ReadMore(int want) {
    if (want < 1) {
        return kStatusSuccessful;
    }
    time_t last = std::time(nullptr);
    long long got = 0;
    while (!AbortRequested(flag_)) {
        unsigned int end = r_head_ + r_size_;
        char* at;
        unsigned int len;
        if (end < capacity_) {
            at = r_buf_.get() + end;
            len = capacity_ - end;
        } else {
            at = r_buf_.get() + (end - capacity_);
            len = capacity_ - r_size_;
        }
        S2S_LOG_DEBUG(
            "[DEBUG] s2s_channel.cpp(%d): ReadMore: want = %d, total = %d, len = %d, "
            "r_head = %d, r_size = %d\n",
            __LINE__, want, static_cast<int>(got), len, r_head_, r_size_);
        int n = read_op_ == PlainReadOp ? ReceivePlain(at, len)
                                        : read_op_(handle_, at, len, wait_, flag_);
        if (n == kStatusConnectionTimeout) {
            time_t now = std::time(nullptr);
            if (timeout_ != 0 && now - last >= static_cast<time_t>(timeout_)) {
                S2S_LOG_DEBUG(
                    "[DEBUG] s2s_channel.cpp(%d): ReadMore: Channel timeout for %u "
                    "seconed\n",
                    __LINE__, timeout_);
                return kStatusConnectionTimeout;
            }
            continue;
        }
        if (n < 0) {
            return n;
        }
        r_size_ += static_cast<unsigned int>(n);
        got += n;
        last = std::time(nullptr);
        if (got >= want) {
            S2S_LOG_DEBUG("[DEBUG] s2s_channel.cpp(%d): ReadMore: read at least %d bytes\n",
                          __LINE__, want);
            return kStatusSuccessful;
        }
    }
    return kStatusInterrupted;
}

unsigned long long Channel::Convert(unsigned long long value) {
    return __builtin_bswap64(value);
}

unsigned int Channel::Convert(unsigned int value) {
    return __builtin_bswap32(value);
}

unsigned short Channel::Convert(unsigned short value) {
    return __builtin_bswap16(value);
}

int Channel::CreateSock() {
    // Close-on-exec: the service runs rsync children, which must not inherit its connections.
    int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    return fd < 0 ? -1 : fd;
}

int Channel::SetLinger(int fd, int seconds) {
    linger value;
    value.l_onoff = 1;
    value.l_linger = seconds;
    if (::setsockopt(fd, SOL_SOCKET, SO_LINGER, &value, sizeof(value)) != 0) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): setsockopt: %s\n", __LINE__,
                       std::strerror(errno));
        return -1;
    }
    return 0;
}

int Channel::SetNonBlock(int fd) {
    if (fd == -1) {
        return -1;
    }
    int flags = ::fcntl(fd, F_GETFL);
    if (flags < 0) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): fcntl: %s\n", __LINE__,
                       std::strerror(errno));
        return -1;
    }
    if ((flags & O_NONBLOCK) == 0 && ::fcntl(fd, F_SETFL, flags | O_NONBLOCK) < 0) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): fcntl: %s\n", __LINE__,
                       std::strerror(errno));
        return -1;
    }
    return 0;
}

int Channel::ConnectWithTimeout(int fd, const char* ip, int port) {
    sockaddr_in addr;
    std::memset(&addr, 0, sizeof(addr));
    // Dotted IPv4 only, no name resolution; anything else (or a port that does not fit in 16
    // bits) is refused rather than connected to a surprise address.
    if (fd == -1 || ip == nullptr || port < 0 || port > 65535 ||
        ::inet_pton(AF_INET, ip, &addr.sin_addr) != 1) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): Invalid argumants (ip: %s, port: %d\n",
                       __LINE__, ip == nullptr ? "(null)" : ip, port);
        return kStatusInvalidArgument;
    }
    addr.sin_family = AF_INET;
    addr.sin_port = htons(static_cast<uint16_t>(port));
    if (::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0) {
        return kStatusSuccessful;
    }
    if (errno != EINPROGRESS) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): connect: %s (%d)\n",
                       __LINE__, std::strerror(errno), errno);
        return kStatusSystemError;
    }
    unsigned int elapsed = 0;
    for (;;) {
        bool ready = false;
        bool exception = false;
        int ret = PollFd(fd, true, wait_, flag_, ready, exception);
        if (ret >= 0) {
            if (exception) {
                Logger::LogMsg(Logger::Warning,
                               "[WARNING] s2s_channel.cpp(%d): connect: exception set\n", __LINE__);
                return kStatusIOError;
            }
            if (ready) {
                return kStatusSuccessful;
            }
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): connect: write fd is not set\n",
                           __LINE__);
            return kStatusSystemError;
        }
        if (ret != kStatusConnectionTimeout) {
            return ret;
        }
        // Each quiet wait counts as three seconds whatever the interval: a silent peer is given
        // up after timeout/3 waits. Deliberate.
        elapsed += 3;
        if (timeout_ != 0 && elapsed >= timeout_) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): Channel timed out during connect (%d "
                           "seconds), abort anyway\n",
                           __LINE__, timeout_);
            return kStatusConnectionTimeout;
        }
    }
}

void Channel::SwitchChannelOp(int mode) {
    // Each set is a row of trampolines from the opaque handle to the typed operation.
    if (mode == kPlainOps) {
        read_op_ = PlainReadOp;
        write_op_ = [](void* h, const void* buf, unsigned int len, const timeval& wait, int* flag) {
            return WriteFd(static_cast<int*>(h), buf, len, wait, flag);
        };
        get_fd_op_ = [](const void* h) { return PlainGetFd(static_cast<const int*>(h)); };
        close_op_ = [](void* h) { PlainClose(static_cast<int*>(h)); };
        is_closed_op_ = [](const void* h) { return PlainIsClosed(static_cast<const int*>(h)); };
    } else {
        read_op_ = [](void* h, void* buf, unsigned int len, const timeval& wait, int* flag) {
            return SSLReadFd(static_cast<SSL*>(h), buf, len, wait, flag);
        };
        write_op_ = [](void* h, const void* buf, unsigned int len, const timeval& wait, int* flag) {
            return SSLWriteFd(static_cast<SSL*>(h), buf, len, wait, flag);
        };
        get_fd_op_ = [](const void* h) { return SSL_get_fd(static_cast<const SSL*>(h)); };
        close_op_ = [](void* h) { SSLClose(static_cast<SSL*>(h)); };
        is_closed_op_ = [](const void* h) { return SSLIsClosed(static_cast<const SSL*>(h)); };
    }
}

int Channel::WaitFd(int fd, fd_set* read_set, fd_set* write_set, fd_set* except_set,
                    const timeval& wait, int* flag) {
    // An fd_set holds descriptors below FD_SETSIZE only; anything else would write past it.
    if (fd < 0 || fd >= FD_SETSIZE) {
        return WaitFailure(fd < 0 ? EBADF : EINVAL);
    }
    while (!AbortRequested(flag)) {
        timeval interval = wait;  // select may change its copy
        if (read_set != nullptr) {
            FD_ZERO(read_set);
            FD_SET(fd, read_set);
        }
        if (write_set != nullptr) {
            FD_ZERO(write_set);
            FD_SET(fd, write_set);
        }
        if (except_set != nullptr) {
            FD_ZERO(except_set);
            FD_SET(fd, except_set);
        }
        int ret = ::select(fd + 1, read_set, write_set, except_set, &interval);
        if (ret > 0) {
            return kStatusSuccessful;
        }
        if (int end = NothingReady(ret); end != 0) {
            return end;
        }
    }
    return kStatusInterrupted;
}

int Channel::PollFd(int fd, bool for_write, const timeval& wait, int* flag, bool& ready,
                    bool& exception) {
    ready = false;
    exception = false;
    if (fd < 0) {
        return WaitFailure(EBADF);
    }
    // A negative interval is refused as select refuses it.
    if (wait.tv_sec < 0 || wait.tv_usec < 0) {
        return WaitFailure(EINVAL);
    }
    // Whole milliseconds, rounded up so that a short interval still waits; a longer one than poll
    // takes waits as long as poll can (about 24 days).
    long long wait_ms = INT_MAX;
    if (wait.tv_sec < INT_MAX / 1000) {
        wait_ms = static_cast<long long>(wait.tv_sec) * 1000 + wait.tv_usec / 1000 +
                  (wait.tv_usec % 1000 != 0 ? 1 : 0);
    }
    const int timeout_ms = static_cast<int>(std::min<long long>(wait_ms, INT_MAX));
    // What select would report: readable on data, hang-up or error; writable on room or error;
    // an exception on urgent data. A hang-up also ends a write wait: the send that follows then
    // reports the peer gone (select would wait out the interval first).
    const short wanted = static_cast<short>((for_write ? POLLOUT : POLLIN) | POLLPRI);
    const short ready_on = static_cast<short>(for_write ? (POLLOUT | POLLERR | POLLHUP)
                                                        : (POLLIN | POLLHUP | POLLERR));
    while (!AbortRequested(flag)) {
        pollfd entry{fd, wanted, 0};
        int ret = ::poll(&entry, 1, timeout_ms);
        if (ret > 0) {
            if ((entry.revents & POLLNVAL) != 0) {  // select fails with EBADF here
                return WaitFailure(EBADF);
            }
            ready = (entry.revents & ready_on) != 0;
            exception = (entry.revents & POLLPRI) != 0;
            return kStatusSuccessful;
        }
        if (int end = NothingReady(ret); end != 0) {
            return end;
        }
    }
    return kStatusInterrupted;
}

namespace {

// Outcome of one recv/send that returned `n`: the count, or -2 with the warnings of a failed or
// closed connection.
int ReadResult(ssize_t n) {
    if (n <= 0) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): read: %s\n", __LINE__,
                       std::strerror(errno));
        if (n == 0) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): Diagnose: select says the socket is "
                           "readable but actually we can't read ... connection closed?\n",
                           __LINE__);
        }
        return kStatusIOError;
    }
    S2S_LOG_DEBUG("[DEBUG] s2s_channel.cpp(%d): ReadFd: read %d bytes\n", __LINE__,
                  static_cast<int>(n));
    return static_cast<int>(n);
}

int WriteResult(ssize_t n) {
    if (n <= 0) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): write: %s\n", __LINE__,
                       std::strerror(errno));
        if (n == 0) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): Diagnose: select says the socket is "
                           "writeable but actually we can't write ... connection closed?\n",
                           __LINE__);
        }
        return kStatusIOError;
    }
    S2S_LOG_DEBUG("[DEBUG] s2s_channel.cpp(%d): WriteFd: write %d bytes\n", __LINE__,
                  static_cast<int>(n));
    return static_cast<int>(n);
}

// True when a non-blocking attempt found the socket not ready: only then is a wait needed.
bool WouldBlock(ssize_t n) {
    return n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR);
}

}  // namespace

int Channel::ReadFd(int* handle, void* buf, unsigned int len, const timeval& wait, int* flag) {
    bool found_nothing = false;
    return ReceiveFd(PlainGetFd(handle), buf, len, wait, flag, found_nothing);
}

int Channel::ReceivePlain(char* at, unsigned int len) {
    const int fd = GetFd();
    bool found_nothing = false;
    if (misses_in_row_ >= kMissesToWait && ++waits_since_try_ < try_every_) {
        // Wait first, then receive as ReadFd does (it waits again after a wake-up without bytes),
        // so that every outcome is the one a trying channel would have.
        bool ready = false;
        bool exception = false;
        int n = PollFd(fd, false, wait_, flag_, ready, exception);
        if (n == kStatusSuccessful) {
            n = ReceiveFd(fd, at, len, wait_, flag_, found_nothing);
            if (n > 0 && static_cast<unsigned int>(n) == len) {
                misses_in_row_ = 0;  // more than the room was queued: the rest is likely there too
            }
        }
        return n;
    }
    waits_since_try_ = 0;
    const int n = ReceiveFd(fd, at, len, wait_, flag_, found_nothing);
    if (!found_nothing) {
        misses_in_row_ = 0;
    } else if (misses_in_row_ < kMissesToWait) {
        ++misses_in_row_;
        try_every_ = 2;  // from the last of these misses on: wait once, then try
    } else {
        try_every_ = std::min(try_every_ * 2, kTryEveryMost);
    }
    return n;
}

int Channel::ReceiveFd(int fd, void* buf, unsigned int len, const timeval& wait, int* flag,
                       bool& found_nothing) {
    if (len == 0) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): ReadFd: request 0\n",
                       __LINE__);
        return kStatusInvalidArgument;
    }
    // Bytes already queued on the socket need no wait: one non-blocking try first (as WriteFd
    // does) saves the wait. A set abort flag still ends the call without reading.
    if (fd >= 0 && !AbortRequested(flag)) {
        ssize_t n = ::recv(fd, buf, len, MSG_DONTWAIT);
        found_nothing = WouldBlock(n);
        if (!found_nothing) {
            return ReadResult(n);
        }
    }
    bool ready = false;
    bool exception = false;
    int ret = PollFd(fd, false, wait, flag, ready, exception);
    if (ret < 0) {
        return ret;
    }
    if (exception) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): ReadFd: exception set\n",
                       __LINE__);
        return kStatusIOError;
    }
    if (!ready) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): ReadFd: select but fd [%d] not ready\n",
                       __LINE__, fd);
        return kStatusSystemError;
    }
    return ReadResult(::recv(fd, buf, len, 0));
}

int Channel::WriteFd(int* handle, const void* buf, unsigned int len, const timeval& wait,
                     int* flag) {
    int fd = PlainGetFd(handle);
    // A socket almost always has room: one non-blocking try first saves a select per flush, and
    // only a full socket waits, bounded as always (FlushWrite checks the abort flag before every
    // call). SIGPIPE stays the program's business: the library never changes its disposition.
    if (fd >= 0) {
        ssize_t n = ::send(fd, buf, len, MSG_DONTWAIT);
        if (!WouldBlock(n)) {
            return WriteResult(n);
        }
    }
    bool ready = false;
    bool exception = false;
    int ret = PollFd(fd, true, wait, flag, ready, exception);
    if (ret < 0) {
        return ret;
    }
    if (exception) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): WriteFd: exception occurs\n", __LINE__);
        return kStatusIOError;
    }
    if (!ready) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): WriteFd: select but fd [%d] not ready\n",
                       __LINE__, fd);
        return kStatusSystemError;
    }
    return WriteResult(::send(fd, buf, len, 0));
}

int Channel::PlainGetFd(const int* handle) {
    return handle == nullptr ? -1 : *handle;
}

void Channel::PlainClose(int* handle) {
    if (handle == nullptr) {
        return;
    }
    int fd = *handle;
    delete handle;  // the heap-held descriptor allocated by Open
    if (fd != -1) {
        ::close(fd);
        S2S_LOG_DEBUG("[DEBUG] s2s_channel.cpp(%d): Channel: socket %d closed\n", __LINE__, fd);
    }
}

bool Channel::PlainIsClosed(const int* handle) {
    return handle == nullptr || *handle == -1;
}

}  // namespace S2S
