// Bulk throughput through a TLS Channel (both ends the library, 64 KiB writes into 80 KiB rings,
// non-blocking sockets with select-bounded waits) against the anchor of raw OpenSSL on blocking
// sockets (SSL_write of 64 KiB, SSL_read into 64 KiB), over TCP loopback, same certificate and
// the same negotiated protocol and cipher. A plain Channel shows what the transport itself costs.
// Each iteration moves 16 MiB one way and waits for a one-byte acknowledgement.
#include <arpa/inet.h>
#include <benchmark/benchmark.h>
#include <netinet/in.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "s2s_channel.h"

namespace {

constexpr size_t kTransfer = 16 * 1024 * 1024;
constexpr size_t kPiece = 64 * 1024;
constexpr unsigned int kCapacity = 81920;

void Die(const char* what) {
    std::fprintf(stderr, "tls bench: %s failed\n", what);
    std::abort();
}

// A self-signed server certificate and key in a private temporary directory.
class ServerIdentity {
  public:
    ServerIdentity() {
        char pattern[] = "/tmp/s2s-tls-bench.XXXXXX";
        if (mkdtemp(pattern) == nullptr) {
            Die("mkdtemp");
        }
        dir_ = pattern;
        EVP_PKEY* key = EVP_EC_gen("P-256");
        X509* cert = X509_new();
        X509_set_version(cert, 2);
        ASN1_INTEGER_set(X509_get_serialNumber(cert), 1);
        X509_gmtime_adj(X509_getm_notBefore(cert), -3600);
        X509_gmtime_adj(X509_getm_notAfter(cert), 86400);
        X509_set_pubkey(cert, key);
        X509_NAME* name = X509_get_subject_name(cert);
        X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC,
                                   reinterpret_cast<const unsigned char*>("bench.example.lan"), -1,
                                   -1, 0);
        X509_set_issuer_name(cert, name);
        if (key == nullptr || X509_sign(cert, key, EVP_sha256()) == 0) {
            Die("certificate");
        }
        FILE* out = std::fopen(cert_file().c_str(), "w");
        if (out == nullptr || PEM_write_X509(out, cert) != 1) {
            Die("writing the certificate");
        }
        std::fclose(out);
        out = std::fopen(key_file().c_str(), "w");
        if (out == nullptr ||
            PEM_write_PrivateKey(out, key, nullptr, nullptr, 0, nullptr, nullptr) != 1) {
            Die("writing the key");
        }
        std::fclose(out);
        X509_free(cert);
        EVP_PKEY_free(key);
    }
    ~ServerIdentity() {
        unlink(cert_file().c_str());
        unlink(key_file().c_str());
        rmdir(dir_.c_str());
    }
    std::string cert_file() const { return dir_ + "/server.pem"; }
    std::string key_file() const { return dir_ + "/server.key"; }

  private:
    std::string dir_;
};

const ServerIdentity& Identity() {
    // A peer that goes away must show as a failed call, not end the run.
    static const bool ignored = signal(SIGPIPE, SIG_IGN) != SIG_ERR;
    (void)ignored;
    static ServerIdentity identity;
    return identity;
}

// A connected TCP loopback pair: `first` dialled, `second` accepted.
void LoopbackPair(int& first, int& second) {
    int listener = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof(addr);
    if (listener < 0 || bind(listener, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 ||
        listen(listener, 1) != 0 ||
        getsockname(listener, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
        Die("listen");
    }
    first = socket(AF_INET, SOCK_STREAM, 0);
    if (first < 0 || connect(first, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
        Die("connect");
    }
    second = accept(listener, nullptr, nullptr);
    if (second < 0) {
        Die("accept");
    }
    close(listener);
}

// --- through Channel ----------------------------------------------------------------------

void ChannelTransfer(benchmark::State& state, bool tls) {
    S2S::Channel::SetCERTPath(Identity().cert_file());
    S2S::Channel::SetPriKeyPath(Identity().key_file());
    int client_fd;
    int server_fd;
    LoopbackPair(client_fd, server_fd);
    std::thread server([server_fd, tls] {
        S2S::Channel channel(kCapacity);
        if (channel.Open(server_fd, true) != 0 || (tls && channel.ConvertToSSLChannel(true) != 0)) {
            Die("server channel");
        }
        std::vector<char> buf(kPiece);
        for (;;) {
            for (size_t got = 0; got < kTransfer; got += kPiece) {
                if (channel.Read(buf.data(), kPiece) != 0) {
                    return;  // the client closed: the run is over
                }
            }
            if (channel.WriteByte(1) != 0 || channel.FlushWrite(0) != 0) {
                Die("acknowledge");
            }
        }
    });
    S2S::Channel channel(kCapacity);
    if (channel.Open(client_fd, true) != 0 || (tls && channel.ConvertToSSLChannel(false) != 0)) {
        Die("client channel");
    }
    const std::vector<char> data(kPiece, 'd');
    for (auto _ : state) {
        for (size_t sent = 0; sent < kTransfer; sent += kPiece) {
            if (channel.Write(data.data(), kPiece) != 0) {
                Die("write");
            }
        }
        unsigned char ack = 0;
        if (channel.FlushWrite(0) != 0 || channel.ReadByte(&ack) != 0) {
            Die("flush");
        }
    }
    channel.Close();
    server.join();
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kTransfer));
}

void BM_TlsChannel(benchmark::State& state) {
    ChannelTransfer(state, true);
}
BENCHMARK(BM_TlsChannel)->Unit(benchmark::kMillisecond)->UseRealTime();

void BM_PlainChannel(benchmark::State& state) {
    ChannelTransfer(state, false);
}
BENCHMARK(BM_PlainChannel)->Unit(benchmark::kMillisecond)->UseRealTime();

// --- raw OpenSSL --------------------------------------------------------------------------

void BM_RawOpenssl(benchmark::State& state) {
    int client_fd;
    int server_fd;
    LoopbackPair(client_fd, server_fd);
    std::thread server([server_fd] {
        SSL_CTX* ctx = SSL_CTX_new(TLS_server_method());
        if (SSL_CTX_use_certificate_chain_file(ctx, Identity().cert_file().c_str()) != 1 ||
            SSL_CTX_use_PrivateKey_file(ctx, Identity().key_file().c_str(), SSL_FILETYPE_PEM) !=
                1) {
            Die("server context");
        }
        SSL* ssl = SSL_new(ctx);
        SSL_set_fd(ssl, server_fd);
        if (SSL_accept(ssl) != 1) {
            Die("SSL_accept");
        }
        std::vector<char> buf(kPiece);
        for (bool open = true; open;) {
            for (size_t got = 0; got < kTransfer;) {
                int n =
                    SSL_read(ssl, buf.data(), static_cast<int>(std::min(kPiece, kTransfer - got)));
                if (n <= 0) {
                    open = false;
                    break;
                }
                got += static_cast<size_t>(n);
            }
            if (open && SSL_write(ssl, "a", 1) != 1) {
                Die("acknowledge");
            }
        }
        SSL_free(ssl);
        SSL_CTX_free(ctx);
        close(server_fd);
    });
    SSL_CTX* ctx = SSL_CTX_new(TLS_client_method());
    SSL* ssl = SSL_new(ctx);
    SSL_set_fd(ssl, client_fd);
    if (SSL_connect(ssl) != 1) {
        Die("SSL_connect");
    }
    const std::vector<char> data(kPiece, 'd');
    for (auto _ : state) {
        for (size_t sent = 0; sent < kTransfer; sent += kPiece) {
            if (SSL_write(ssl, data.data(), static_cast<int>(kPiece)) != static_cast<int>(kPiece)) {
                Die("SSL_write");
            }
        }
        char ack;
        if (SSL_read(ssl, &ack, 1) != 1) {
            Die("SSL_read");
        }
    }
    SSL_shutdown(ssl);
    SSL_free(ssl);
    SSL_CTX_free(ctx);
    shutdown(client_fd, SHUT_RDWR);
    close(client_fd);
    server.join();
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kTransfer));
}
BENCHMARK(BM_RawOpenssl)->Unit(benchmark::kMillisecond)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
