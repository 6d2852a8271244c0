// The TLS layer of Channel: converts an open plain channel into a TLS one in place and provides
// the TLS operation set (read, write, close, closed test) that SwitchChannelOp installs.
#include <errno.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <string>

#include "net/tls_host_match.h"
#include "s2s_channel.h"
#include "s2s_logger.h"

namespace S2S {

namespace {

std::string& CertPathStorage() {
    static std::string path("/tmp/.cloud_certs");
    return path;
}

std::string& KeyPathStorage() {
    static std::string path("/tmp/.cloud_server.key");
    return path;
}

std::string& CAPathStorage() {
    static std::string path("/certs.pem");
    return path;
}

// A server key file is never protected by a pass phrase here: without this callback OpenSSL
// would prompt on the terminal and block a daemon forever. Refusing makes loading fail cleanly.
int NoPassPhrase(char*, int, int, void*) {
    return 0;
}

// The case folding of certificate names: ASCII letters only, independent of the locale.
char FoldCase(char c) {
    return (c >= 'A' && c <= 'Z') ? static_cast<char>(c - 'A' + 'a') : c;
}

bool EqualIgnoringCase(const std::string& a, const std::string& b) {
    return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin(), [](char x, char y) {
               return FoldCase(x) == FoldCase(y);
           });
}

// The bytes of a certificate string, or false when it holds an embedded NUL.
bool CertificateString(const unsigned char* data, int length, std::string& out) {
    if (data == nullptr || length < 0) {
        return false;
    }
    out.assign(reinterpret_cast<const char*>(data), static_cast<size_t>(length));
    return out.find('\0') == std::string::npos;
}

bool CommonNameMatches(X509* cert, const std::string& host) {
    X509_NAME* subject = X509_get_subject_name(cert);
    int index = X509_NAME_get_index_by_NID(subject, NID_commonName, -1);
    if (index < 0) {
        return false;
    }
    ASN1_STRING* value = X509_NAME_ENTRY_get_data(X509_NAME_get_entry(subject, index));
    unsigned char* utf8 = nullptr;
    int length = ASN1_STRING_to_UTF8(&utf8, value);
    if (length < 0) {
        ERR_clear_error();  // an unconvertible name is simply no match
        return false;
    }
    std::string name;
    bool valid = CertificateString(utf8, length, name);
    OPENSSL_free(utf8);
    return valid && tls::HostNameMatches(name, host);
}

bool AltNameMatches(X509* cert, const std::string& host) {
    auto* names =
        static_cast<GENERAL_NAMES*>(X509_get_ext_d2i(cert, NID_subject_alt_name, nullptr, nullptr));
    if (names == nullptr) {
        return false;
    }
    bool matched = false;
    for (int i = 0; i < sk_GENERAL_NAME_num(names) && !matched; ++i) {
        const GENERAL_NAME* entry = sk_GENERAL_NAME_value(names, i);
        if (entry->type != GEN_DNS) {
            continue;
        }
        std::string name;
        matched = CertificateString(ASN1_STRING_get0_data(entry->d.dNSName),
                                    ASN1_STRING_length(entry->d.dNSName), name) &&
                  tls::HostNameMatches(name, host);
    }
    GENERAL_NAMES_free(names);
    return matched;
}

// The context's suites below TLS 1.3 as a cipher string, in their order (TLS 1.3 suites are
// configured apart and no cipher string touches them).
std::string LegacyCipherList(SSL_CTX* ctx) {
    std::string list;
    STACK_OF(SSL_CIPHER)* ciphers = SSL_CTX_get_ciphers(ctx);
    for (int i = 0; i < sk_SSL_CIPHER_num(ciphers); ++i) {
        const SSL_CIPHER* cipher = sk_SSL_CIPHER_value(ciphers, i);
        if (std::strcmp(SSL_CIPHER_get_version(cipher), "TLSv1.3") == 0) {
            continue;
        }
        if (!list.empty()) {
            list += ':';
        }
        list += SSL_CIPHER_get_name(cipher);
    }
    return list;
}

// OpenSSL reports a want-read as a hard failure while an older error sits in this thread's
// queue, so the queue must be empty before every handshake, read and write call. What is
// dropped here was either logged where it arose or belongs to an operation that already ended.
void ResetErrorQueue() {
    ERR_clear_error();
}

// The end of a failed step of InitSSL, its warning logged already: the TLS error queue goes to
// the log and what the steps made so far is freed. Always -1.
int AbandonInit(SSL*& ssl, SSL_CTX*& ctx) {
    Channel::log_ssl();
    Channel::DeinitSSL(ssl, ctx, false);
    return -1;
}

// Channel::PollFd, handed in by the channel (it is the channel's own step).
using PollFdFn = int (*)(int fd, bool for_write, const timeval& wait, int* flag, bool& ready,
                         bool& exception);

// One bounded wait of a record read or write (`who`: "ReadFd" or "WriteFd") until `fd` is
// readable (or, with `write`, writable): 0 when it is; the wait's own negative status; -2 on an
// exception, -3 when the wait returned without the descriptor ready.
int WaitReady(PollFdFn poll_fd, int fd, bool write, const timeval& wait, int* flag,
              const char* who) {
    bool ready = false;
    bool exception = false;
    const int status = poll_fd(fd, write, wait, flag, ready, exception);
    if (status < 0) {
        return status;
    }
    if (exception) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): %s: exception set\n",
                       __LINE__, who);
        return -2;
    }
    if (!ready) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): %s: select but fd [%d] not ready\n",
                       __LINE__, who, fd);
        return -3;
    }
    return 0;
}

}  // namespace

namespace tls {

bool HostNameMatches(const std::string& cert_name, const std::string& host) {
    if (cert_name.empty() || cert_name[0] != '*') {
        return EqualIgnoringCase(cert_name, host);
    }
    if (cert_name.size() < 3 || cert_name[1] != '.') {
        return false;
    }
    const std::string domain = cert_name.substr(2);
    if (EqualIgnoringCase(domain, host)) {
        return true;
    }
    size_t dot = host.find('.');
    return dot != std::string::npos && EqualIgnoringCase(domain, host.substr(dot + 1));
}

bool CertificateMatchesHost(X509* cert, const std::string& host) {
    return cert != nullptr && (CommonNameMatches(cert, host) || AltNameMatches(cert, host));
}

}  // namespace tls

const std::string& Channel::GetCertPath() {
    return CertPathStorage();
}

const std::string& Channel::GetKeyPath() {
    return KeyPathStorage();
}

const std::string& Channel::GetCAPath() {
    return CAPathStorage();
}

void Channel::SetCERTPath(std::string path) {
    CertPathStorage() = std::move(path);
}

void Channel::SetPriKeyPath(std::string path) {
    KeyPathStorage() = std::move(path);
}

void Channel::SetVerifyCAPath(const std::string& path) {
    CAPathStorage() = path;
}

void Channel::log_ssl() {
    unsigned long code;
    while ((code = ERR_get_error()) != 0) {
        char text[256];
        ERR_error_string_n(code, text, sizeof(text));
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): ssl-errors: %s\n", __LINE__,
                       text);
    }
}

int Channel::InstallCERT(SSL_CTX* ctx) {
    Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): cert path = %s\n", __LINE__,
                   GetCertPath().c_str());
    if (SSL_CTX_use_certificate_chain_file(ctx, GetCertPath().c_str()) != 1) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): Install certificate failed\n", __LINE__);
        log_ssl();
        return -1;
    }
    return 0;
}

int Channel::InstallPriKey(SSL_CTX* ctx) {
    SSL_CTX_set_default_passwd_cb(ctx, NoPassPhrase);
    if (SSL_CTX_use_PrivateKey_file(ctx, GetKeyPath().c_str(), SSL_FILETYPE_PEM) != 1) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): Install private key failed\n", __LINE__);
        log_ssl();
        return -1;
    }
    return 0;
}

int Channel::InstallVerifyCA(SSL_CTX* ctx) {
    if (SSL_CTX_load_verify_locations(ctx, GetCAPath().c_str(), nullptr) != 1) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): SSL_CTX_load_verify_locations(%s) failed\n",
                       __LINE__, GetCAPath().c_str());
        log_ssl();
        return -1;
    }
    return 0;
}

int Channel::InitSSL(SSL*& ssl, SSL_CTX*& ctx, bool server, bool allow_untrusted) {
    ctx = SSL_CTX_new(server ? TLS_server_method() : TLS_client_method());
    if (ctx == nullptr) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): m_ssl_ctx created failed\n",
                       __LINE__);
        return AbandonInit(ssl, ctx);
    }
    // The channel's write loop hands over whatever is contiguous in its ring and advances by what
    // was sent, like a plain send(); a retry may come with more bytes than the one that stalled.
    SSL_CTX_set_mode(ctx, SSL_MODE_ENABLE_PARTIAL_WRITE | SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER);
    // The peer is judged after the handshake (ConvertToSSLChannel), never by OpenSSL aborting it.
    SSL_CTX_set_verify(ctx, SSL_VERIFY_NONE, nullptr);
    if (server) {
        if (InstallCERT(ctx) < 0) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): Open: init ssl certificate failed\n",
                           __LINE__);
            return AbandonInit(ssl, ctx);
        }
        if (InstallPriKey(ctx) < 0) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): Open: init ssl private key failed\n",
                           __LINE__);
            return AbandonInit(ssl, ctx);
        }
        ssl = SSL_new(ctx);
        if (ssl == nullptr) {
            Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): m_ssl created failed\n",
                           __LINE__);
            return AbandonInit(ssl, ctx);
        }
        SSL_set_accept_state(ssl);
        return 0;
    }
    // Current OpenSSL builds carry no RC4: the list is refused and the defaults stay, which is
    // what we want. A refused list still replaces the context's list with one that holds no
    // suite below TLS 1.3, so the list the context had (OpenSSL's defaults as the system
    // configuration shaped them) is put back. The refusal is reported by the warning; its
    // queued error must not linger.
    const std::string defaults = LegacyCipherList(ctx);
    if (SSL_CTX_set_cipher_list(ctx, "RC4-MD5") != 1) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): can't set cipher suit to "
                       "SSL3_TXT_RSA_RC4_128_MD5\n",
                       __LINE__);
        ERR_clear_error();
        if (!defaults.empty() && SSL_CTX_set_cipher_list(ctx, defaults.c_str()) != 1) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): m_ssl_ctx created failed\n", __LINE__);
            return AbandonInit(ssl, ctx);
        }
    }
    ssl = SSL_new(ctx);
    if (ssl == nullptr) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): m_ssl created failed\n",
                       __LINE__);
        return AbandonInit(ssl, ctx);
    }
    // The session consults the context's store when it verifies, so loading after SSL_new counts.
    if (!allow_untrusted && InstallVerifyCA(ctx) < 0) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): InitSSL(): set Verify store fail\n",
                       __LINE__);
        return AbandonInit(ssl, ctx);
    }
    SSL_set_connect_state(ssl);
    return 0;
}

void Channel::DeinitSSL(SSL*& ssl, SSL_CTX*& ctx, bool quiet) {
    if (ssl != nullptr) {
        if (quiet) {
            SSL_set_quiet_shutdown(ssl, 1);
        }
        SSL_shutdown(ssl);
        // A session torn down before or during its handshake cannot shut down and says so; the
        // failure that led here has been reported already.
        ERR_clear_error();
        SSL_free(ssl);
        ssl = nullptr;
    }
    if (ctx != nullptr) {
        SSL_CTX_free(ctx);
        ctx = nullptr;
    }
}

int Channel::SSLHandshake(SSL* ssl, timeval wait, unsigned int timeout, int* /*flag*/) {
    // The abort flag is deliberately not passed on: only the timeout ends a silent handshake.
    const int fd = SSL_get_fd(ssl);
    unsigned int elapsed = 0;
    for (;;) {
        ResetErrorQueue();
        int ret = SSL_do_handshake(ssl);
        if (ret == 1) {
            return 0;
        }
        int error = SSL_get_error(ssl, ret);
        if (ret == 0) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): SSLHandshake: SSL error code: %d\n",
                           __LINE__, error);
            log_ssl();
            return -2;
        }
        if (error != SSL_ERROR_WANT_READ && error != SSL_ERROR_WANT_WRITE) {
            Logger::LogMsg(
                Logger::Warning,
                "[WARNING] s2s_channel.cpp(%d): SSLHandshake: SSL fatel error code: %d\n", __LINE__,
                error);
            log_ssl();
            return -2;
        }
        bool ready = false;
        bool exception = false;
        int status = PollFd(fd, error != SSL_ERROR_WANT_READ, wait, nullptr, ready, exception);
        if (status == -9) {
            elapsed += static_cast<unsigned int>(wait.tv_sec);
            if (timeout != 0 && elapsed >= timeout) {
                Logger::LogMsg(Logger::Warning,
                               "[WARNING] s2s_channel.cpp(%d): SSLHandshake: timed out during "
                               "connect (%d seconds), abort anyway\n",
                               __LINE__, static_cast<int>(timeout));
                return -9;
            }
            continue;
        }
        if (status < 0) {
            return status;
        }
        if (exception) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): SSLHandshake: exception set\n",
                           __LINE__);
            return -2;
        }
        if (!ready) {
            Logger::LogMsg(
                Logger::Warning,
                "[WARNING] s2s_channel.cpp(%d): SSLHandshake: select returns but fd is not set\n",
                __LINE__);
            return -3;
        }
        elapsed = 0;
        Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): SSLHandshake: reset timeout\n",
                       __LINE__);
    }
}

int Channel::SSLReadFd(SSL* ssl, void* buf, unsigned int len, const timeval& wait, int* flag) {
    if (len == 0) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): ReadFd: request 0\n",
                       __LINE__);
        return -4;
    }
    // Bytes OpenSSL already decrypted are invisible to select: hand them out first.
    int pending = SSL_pending(ssl);
    if (pending > 0) {
        ResetErrorQueue();
        int n = SSL_read(ssl, buf, static_cast<int>(std::min(len, static_cast<unsigned>(pending))));
        if (n < 1) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): Diagnose: SSL_read failed\n", __LINE__);
            log_ssl();
            return -2;
        }
        Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): ReadFd: read %d bytes\n",
                       __LINE__, n);
        return n;
    }
    const int status = WaitReady(&PollFd, SSL_get_fd(ssl), false, wait, flag, "ReadFd");
    if (status < 0) {
        return status;
    }
    ResetErrorQueue();
    // SSL_read takes an int: a ring larger than INT_MAX is read in pieces.
    int n = SSL_read(ssl, buf, static_cast<int>(std::min(len, 0x7fffffffU)));
    if (n > 0) {
        Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): ReadFd: read %d bytes\n",
                       __LINE__, n);
        return n;
    }
    int error = SSL_get_error(ssl, n);
    if (error == SSL_ERROR_WANT_READ || error == SSL_ERROR_WANT_WRITE) {
        // Only part of a record (or a handshake message such as a session ticket) arrived: to the
        // channel's read loop this is one quiet interval.
        Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): SSL want read", __LINE__);
        return -9;
    }
    // The peer closed (with or without close-notify) or the record was bad.
    log_ssl();
    return -2;
}

int Channel::SSLWriteFd(SSL* ssl, const void* buf, unsigned int len, const timeval& wait,
                        int* flag) {
    const int status = WaitReady(&PollFd, SSL_get_fd(ssl), true, wait, flag, "WriteFd");
    if (status < 0) {
        return status;
    }
    ResetErrorQueue();
    int n = SSL_write(ssl, buf, static_cast<int>(std::min(len, 0x7fffffffU)));
    if (n > 0) {
        Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): WriteFd: write %d bytes\n",
                       __LINE__, n);
        return n;
    }
    int saved_errno = errno;
    int error = SSL_get_error(ssl, n);
    if (error == SSL_ERROR_WANT_READ || error == SSL_ERROR_WANT_WRITE) {
        Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): SSL want write\n", __LINE__);
        return -9;
    }
    if (error == SSL_ERROR_SYSCALL) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): syscall error: n = %d, ssl_ret = %d, "
                       "errno = %d, err = %s\n",
                       __LINE__, n, error, saved_errno, std::strerror(saved_errno));
        log_ssl();
        return -3;
    }
    Logger::LogMsg(Logger::Warning,
                   "[WARNING] s2s_channel.cpp(%d): misc error: n = %d, ssl_ret = %d, errno = %d\n",
                   __LINE__, n, error, saved_errno);
    log_ssl();
    return -2;
}

void Channel::SSLClose(SSL* ssl) {
    Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): destroy ssl obj %p\n", __LINE__,
                   static_cast<void*>(ssl));
    if (ssl == nullptr) {
        return;
    }
    const int fd = SSL_get_fd(ssl);
    // The context was created for this session alone; the session holds the only other
    // reference to it (see ConvertToSSLChannel).
    SSL_CTX* ctx = SSL_get_SSL_CTX(ssl);
    ResetErrorQueue();
    // Sends close-notify when the socket takes it; a peer that is gone already is no error here.
    SSL_shutdown(ssl);
    ERR_clear_error();
    SSL_free(ssl);
    if (ctx != nullptr) {
        SSL_CTX_free(ctx);
    }
    if (fd >= 0) {
        if (shutdown(fd, SHUT_RDWR) != 0) {
            Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): Channel: shutdown: %s\n",
                           __LINE__, std::strerror(errno));
        }
        close(fd);
        Logger::LogMsg(Logger::Debug, "[DEBUG] s2s_channel.cpp(%d): Channel: socket %d closed\n",
                       __LINE__, fd);
    }
}

bool Channel::SSLIsClosed(const SSL* ssl) {
    return ssl == nullptr;
}

int Channel::ConvertToSSLChannel(bool server) {
    if (is_ssl_) {
        Logger::LogMsg(
            Logger::Warning,
            "[WARNING] s2s_channel.cpp(%d): ConvertToSSLChannel: Channel is SSL channel, "
            "no need to be converted\n",
            __LINE__);
        return 0;
    }
    SSL* ssl = nullptr;
    SSL_CTX* ctx = nullptr;
    if (InitSSL(ssl, ctx, server, IsAllowingUntrust()) < 0) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): Open: init ssl failed\n",
                       __LINE__);
        return -2;
    }
    // A closed channel has no socket (-1): that is a binding failure like any other.
    const int fd = GetFd();
    if (fd < 0 || SSL_set_fd(ssl, fd) != 1) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_channel.cpp(%d): set fd failed\n", __LINE__);
        log_ssl();
        DeinitSSL(ssl, ctx, true);
        return -2;
    }
    if (SSLHandshake(ssl, wait_, timeout_, flag_) < 0) {
        Logger::LogMsg(Logger::Warning,
                       "[WARNING] s2s_channel.cpp(%d): Open to SSL connect to server failed\n",
                       __LINE__);
        DeinitSSL(ssl, ctx, true);
        return -2;
    }
    if (!IsAllowingUntrust()) {
        bool verified = SSL_get_verify_result(ssl) == X509_V_OK;
        if (verified && !ssl_hostname_.empty()) {
            X509* peer = SSL_get1_peer_certificate(ssl);
            verified = tls::CertificateMatchesHost(peer, ssl_hostname_);
            X509_free(peer);
        }
        if (!verified) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] s2s_channel.cpp(%d): ConvertToSSLChannel: Verify Fail!\n",
                           __LINE__);
            DeinitSSL(ssl, ctx, true);
            return -24;
        }
    }
    // The session owns the descriptor from now on; only the plain holder goes. It was allocated
    // by Open as a C-shaped handle, hence the explicit delete.
    delete static_cast<int*>(handle_);
    handle_ = ssl;
    // The session keeps the context alive; SSLClose releases both.
    ctx = nullptr;
    SwitchChannelOp(kSSLOps);
    is_ssl_ = true;
    return 0;
}

}  // namespace S2S
