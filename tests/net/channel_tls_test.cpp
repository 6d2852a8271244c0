// TLS channels against real peers: `openssl s_server` / `openssl s_client` processes, the
// library's own other side in a thread, and a raw OpenSSL peer that misbehaves on purpose. Every
// certificate is made at run time in a temporary directory; the fixed certificate paths are
// always redirected through the setters.
#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <ostream>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "net/tls_host_match.h"
#include "s2s_channel.h"
#include "s2s_logger.h"
#include "support/test_util.h"

extern char** environ;

namespace {

using S2S::Channel;
using s2s_test::TempDir;
using namespace std::chrono_literals;

// ---------------------------------------------------------------------------------------------
// Certificates

using KeyPtr = std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)>;
using CertPtr = std::unique_ptr<X509, decltype(&X509_free)>;

struct CertSpec {
    std::string common_name;       // may hold an embedded NUL
    std::vector<std::string> dns;  // subject alternative names, in order; may hold NULs
    long valid_from = -3600;       // seconds relative to now
    long valid_until = 86400;
    bool ca = false;
};

KeyPtr NewKey() {
    return KeyPtr(EVP_EC_gen("P-256"), EVP_PKEY_free);
}

void AddExtension(X509* cert, X509* issuer, int nid, const char* value) {
    X509V3_CTX ctx;
    X509V3_set_ctx(&ctx, issuer, cert, nullptr, nullptr, 0);
    X509_EXTENSION* ext = X509V3_EXT_conf_nid(nullptr, &ctx, nid, value);
    ASSERT_NE(ext, nullptr);
    X509_add_ext(cert, ext, -1);
    X509_EXTENSION_free(ext);
}

// Signs with `issuer_key`; a null issuer makes the certificate self-signed.
CertPtr MakeCert(const CertSpec& want, EVP_PKEY* key, X509* issuer, EVP_PKEY* issuer_key) {
    static long serial = 1;
    CertPtr cert(X509_new(), X509_free);
    X509_set_version(cert.get(), 2);
    ASN1_INTEGER_set(X509_get_serialNumber(cert.get()), serial++);
    X509_gmtime_adj(X509_getm_notBefore(cert.get()), want.valid_from);
    X509_gmtime_adj(X509_getm_notAfter(cert.get()), want.valid_until);
    X509_set_pubkey(cert.get(), key);
    X509_NAME* name = X509_get_subject_name(cert.get());
    X509_NAME_add_entry_by_txt(name, "O", MBSTRING_UTF8,
                               reinterpret_cast<const unsigned char*>("s2s tests"), -1, -1, 0);
    X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_UTF8,
                               reinterpret_cast<const unsigned char*>(want.common_name.data()),
                               static_cast<int>(want.common_name.size()), -1, 0);
    X509* signer = issuer != nullptr ? issuer : cert.get();
    X509_set_issuer_name(cert.get(), X509_get_subject_name(signer));
    AddExtension(cert.get(), signer, NID_basic_constraints,
                 want.ca ? "critical,CA:TRUE" : "critical,CA:FALSE");
    AddExtension(cert.get(), signer, NID_key_usage,
                 want.ca ? "critical,keyCertSign,cRLSign" : "critical,digitalSignature");
    AddExtension(cert.get(), signer, NID_subject_key_identifier, "hash");
    if (!want.dns.empty()) {
        GENERAL_NAMES* names = sk_GENERAL_NAME_new_null();
        for (const std::string& dns : want.dns) {
            ASN1_IA5STRING* value = ASN1_IA5STRING_new();
            ASN1_STRING_set(value, dns.data(), static_cast<int>(dns.size()));
            GENERAL_NAME* entry = GENERAL_NAME_new();
            GENERAL_NAME_set0_value(entry, GEN_DNS, value);
            sk_GENERAL_NAME_push(names, entry);
        }
        X509_add1_ext_i2d(cert.get(), NID_subject_alt_name, names, 0, X509V3_ADD_DEFAULT);
        GENERAL_NAMES_free(names);
    }
    X509_sign(cert.get(), issuer_key != nullptr ? issuer_key : key, EVP_sha256());
    return cert;
}

void WritePem(const std::string& path, const std::vector<X509*>& chain) {
    FILE* file = std::fopen(path.c_str(), "w");
    ASSERT_NE(file, nullptr) << path;
    for (X509* cert : chain) {
        PEM_write_X509(file, cert);
    }
    std::fclose(file);
}

// Private keys are written 0600, optionally protected by a pass phrase.
void WriteKey(const std::string& path, EVP_PKEY* key, const char* pass_phrase = nullptr) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0) << path;
    FILE* file = fdopen(fd, "w");
    ASSERT_NE(file, nullptr);
    const EVP_CIPHER* cipher = pass_phrase != nullptr ? EVP_aes_256_cbc() : nullptr;
    PEM_write_PrivateKey(
        file, key, cipher, reinterpret_cast<unsigned char*>(const_cast<char*>(pass_phrase)),
        pass_phrase != nullptr ? static_cast<int>(std::strlen(pass_phrase)) : 0, nullptr, nullptr);
    std::fclose(file);
}

// The certificate set of one test program: a CA, server certificates of every kind it signs,
// and a self-signed one. Server files are "<kind>.pem" (leaf then CA) and "<kind>.key".
class Certificates {
  public:
    Certificates() : dir_("s2s-tls-certs") {
        KeyPtr ca_key = NewKey();
        CertSpec ca_spec;
        ca_spec.common_name = "s2s test CA";
        ca_spec.ca = true;
        CertPtr ca = MakeCert(ca_spec, ca_key.get(), nullptr, nullptr);
        WritePem(ca_file(), {ca.get()});

        auto issue = [&](const std::string& kind, const CertSpec& want, bool self_signed) {
            KeyPtr key = NewKey();
            CertPtr cert = self_signed ? MakeCert(want, key.get(), nullptr, nullptr)
                                       : MakeCert(want, key.get(), ca.get(), ca_key.get());
            if (self_signed) {
                WritePem(cert_file(kind), {cert.get()});
            } else {
                WritePem(cert_file(kind), {cert.get(), ca.get()});
            }
            WriteKey(key_file(kind), key.get());
        };
        CertSpec plain;
        plain.common_name = "nas.example.lan";
        issue("plain", plain, false);
        CertSpec wildcard;
        wildcard.common_name = "*.Example.LAN";
        issue("wildcard", wildcard, false);
        CertSpec san;
        san.common_name = "files.example.org";
        san.dns = {"backup.example.org", "NAS2.Example.Org"};
        issue("san", san, false);
        CertSpec expired = plain;
        expired.valid_from = -2 * 86400;
        expired.valid_until = -86400;
        issue("expired", expired, false);
        issue("selfsigned", plain, true);

        // A key that belongs to no certificate here, and the plain key under a pass phrase.
        KeyPtr stray = NewKey();
        WriteKey(dir_ / "stray.key", stray.get());
        FILE* in = std::fopen(key_file("plain").c_str(), "r");
        EVP_PKEY* plain_key = PEM_read_PrivateKey(in, nullptr, nullptr, nullptr);
        std::fclose(in);
        WriteKey(dir_ / "locked.key", plain_key, "not-for-the-log");
        EVP_PKEY_free(plain_key);
    }

    std::string ca_file() const { return dir_ / "ca.pem"; }
    std::string cert_file(const std::string& kind) const { return dir_ / (kind + ".pem"); }
    std::string key_file(const std::string& kind) const { return dir_ / (kind + ".key"); }
    std::string path(const std::string& name) const { return dir_ / name; }

  private:
    TempDir dir_;
};

// ---------------------------------------------------------------------------------------------
// Processes, sockets, log capture

// A child process with its standard output and error drained into memory by a thread, so the
// child never blocks on a full pipe; standard input is a pipe or a file.
class Child {
  public:
    explicit Child(const std::vector<std::string>& args, const std::string& stdin_file = "") {
        int in[2] = {-1, -1};
        int out[2];
        int err[2];
        if (stdin_file.empty() && pipe2(in, O_CLOEXEC) != 0) {
            throw std::runtime_error("pipe2");
        }
        if (pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0) {
            throw std::runtime_error("pipe2");
        }
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        if (stdin_file.empty()) {
            posix_spawn_file_actions_adddup2(&actions, in[0], 0);
        } else {
            posix_spawn_file_actions_addopen(&actions, 0, stdin_file.c_str(), O_RDONLY, 0);
        }
        posix_spawn_file_actions_adddup2(&actions, out[1], 1);
        posix_spawn_file_actions_adddup2(&actions, err[1], 2);
        std::vector<char*> argv;
        for (const std::string& arg : args) {
            argv.push_back(const_cast<char*>(arg.c_str()));
        }
        argv.push_back(nullptr);
        int rc = posix_spawnp(&pid_, argv[0], &actions, nullptr, argv.data(), environ);
        posix_spawn_file_actions_destroy(&actions);
        if (stdin_file.empty()) {
            close(in[0]);
            stdin_ = in[1];
        }
        close(out[1]);
        close(err[1]);
        if (rc != 0) {
            close(out[0]);
            close(err[0]);
            CloseStdin();
            throw std::runtime_error("posix_spawnp " + args[0] + ": " + std::strerror(rc));
        }
        drain_ = std::thread([this, o = out[0], e = err[0]] { Drain(o, e); });
    }

    ~Child() {
        CloseStdin();
        if (!Exited(0ms)) {
            kill(pid_, SIGTERM);
        }
        drain_.join();
        int status;
        waitpid(pid_, &status, 0);
    }

    Child(const Child&) = delete;
    Child& operator=(const Child&) = delete;

    void Send(const std::string& bytes) {
        ASSERT_EQ(write(stdin_, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    }

    void CloseStdin() {
        if (stdin_ >= 0) {
            close(stdin_);
            stdin_ = -1;
        }
    }

    // Waits until `done(stdout, stderr)` holds; false when the limit passed or the child ended
    // first.
    bool WaitUntil(const std::function<bool(const std::string&, const std::string&)>& done,
                   std::chrono::milliseconds limit = 20s) {
        std::unique_lock<std::mutex> lock(mutex_);
        changed_.wait_for(lock, limit, [&] { return done(out_, err_) || done_; });
        return done(out_, err_);
    }

    // Waits until `text` appears on standard output (or, with `on_stderr`, standard error).
    bool WaitOutput(const std::string& text, bool on_stderr = false,
                    std::chrono::milliseconds limit = 20s) {
        return WaitUntil(
            [&](const std::string& out, const std::string& err) {
                return (on_stderr ? err : out).find(text) != std::string::npos;
            },
            limit);
    }

    // True once the child closed both output streams (it exited, in practice).
    bool Exited(std::chrono::milliseconds limit = 20s) {
        std::unique_lock<std::mutex> lock(mutex_);
        return changed_.wait_for(lock, limit, [&] { return done_; });
    }

    std::string Out() {
        std::lock_guard<std::mutex> lock(mutex_);
        return out_;
    }
    std::string Err() {
        std::lock_guard<std::mutex> lock(mutex_);
        return err_;
    }

  private:
    void Drain(int out, int err) {
        pollfd fds[2] = {{out, POLLIN, 0}, {err, POLLIN, 0}};
        int open_streams = 2;
        char buf[65536];
        while (open_streams > 0) {
            if (poll(fds, 2, -1) < 0) {
                if (errno == EINTR) {
                    continue;
                }
                break;
            }
            for (int i = 0; i < 2; ++i) {
                if (fds[i].fd < 0 || fds[i].revents == 0) {
                    continue;
                }
                ssize_t n = read(fds[i].fd, buf, sizeof(buf));
                if (n <= 0) {
                    close(fds[i].fd);
                    fds[i].fd = -1;
                    --open_streams;
                    continue;
                }
                std::lock_guard<std::mutex> lock(mutex_);
                (i == 0 ? out_ : err_).append(buf, static_cast<size_t>(n));
                changed_.notify_all();
            }
        }
        std::lock_guard<std::mutex> lock(mutex_);
        done_ = true;
        changed_.notify_all();
    }

    pid_t pid_ = -1;
    int stdin_ = -1;
    std::thread drain_;
    std::mutex mutex_;
    std::condition_variable changed_;
    std::string out_;
    std::string err_;
    bool done_ = false;
};

// `openssl s_server` answering one connection, reversing each line it receives.
class OpensslServer {
  public:
    OpensslServer(const std::string& cert, const std::string& key,
                  const std::vector<std::string>& extra = {}) {
        std::vector<std::string> args = {"openssl",  "s_server", "-accept", "127.0.0.1:0",
                                         "-cert",    cert,       "-key",    key,
                                         "-naccept", "1",        "-rev"};
        args.insert(args.end(), extra.begin(), extra.end());
        child_ = std::make_unique<Child>(args);
        // Ready once it printed the address it listens on, a whole line.
        const std::string marker = "ACCEPT 127.0.0.1:";
        auto announced = [&](const std::string& out, const std::string&) {
            size_t at = out.find(marker);
            return at != std::string::npos && out.find('\n', at) != std::string::npos;
        };
        if (!child_->WaitUntil(announced)) {
            throw std::runtime_error("s_server did not start: " + child_->Err());
        }
        const std::string out = child_->Out();
        port_ = std::stoi(out.substr(out.find(marker) + marker.size()));
    }

    int port() const { return port_; }
    Child& process() { return *child_; }

  private:
    std::unique_ptr<Child> child_;
    int port_ = 0;
};

// A listening TCP socket on 127.0.0.1 with a kernel-chosen port.
class Listener {
  public:
    Listener() {
        fd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t len = sizeof(addr);
        if (fd_ < 0 || bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 ||
            listen(fd_, 8) != 0 ||
            getsockname(fd_, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
            if (fd_ >= 0) {
                close(fd_);
            }
            throw std::runtime_error("listener");
        }
        port_ = ntohs(addr.sin_port);
    }
    ~Listener() { close(fd_); }
    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;

    int port() const { return port_; }

    // A connected socket, or -1 when nobody came within `limit`.
    int Accept(std::chrono::milliseconds limit = 20s) {
        pollfd pfd = {fd_, POLLIN, 0};
        if (poll(&pfd, 1, static_cast<int>(limit.count())) != 1) {
            return -1;
        }
        return accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
    }

  private:
    int fd_ = -1;
    int port_ = 0;
};

int ConnectRaw(int port) {
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(static_cast<uint16_t>(port));
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

// Reaches the session behind a TLS channel.
class TestChannel : public Channel {
  public:
    explicit TestChannel(unsigned int capacity = 81920) : Channel(capacity) {}
    SSL* Session() const { return is_ssl_ ? static_cast<SSL*>(handle_) : nullptr; }
    bool IsSSL() const { return is_ssl_; }
    unsigned int BufferedRead() const { return r_size_; }
    unsigned int BufferedWrite() const { return w_size_; }
};

// The library accepting one connection from `listener` onto `channel`.
int AcceptInto(Listener& listener, Channel& channel) {
    int fd = listener.Accept();
    if (fd < 0) {
        return -100;
    }
    int status = channel.Open(fd, true);
    if (status != 0) {
        close(fd);
    }
    return status;
}

std::string RandomBytes(size_t size, unsigned seed) {
    std::mt19937 generator(seed);
    std::string bytes(size, '\0');
    for (char& c : bytes) {
        c = static_cast<char>(generator());
    }
    return bytes;
}

// Writes `data` in pieces of `piece` bytes (at most the capacity) and flushes.
int WriteAll(Channel& channel, const std::string& data, size_t piece) {
    for (size_t at = 0; at < data.size(); at += piece) {
        size_t n = std::min(piece, data.size() - at);
        int status = channel.Write(data.data() + at, static_cast<unsigned int>(n));
        if (status != 0) {
            return status;
        }
    }
    return channel.FlushWrite(0);
}

// Reads `size` bytes in pieces of `piece` bytes.
int ReadAll(Channel& channel, size_t size, size_t piece, std::string& data) {
    data.assign(size, '\0');
    for (size_t at = 0; at < size; at += piece) {
        size_t n = std::min(piece, size - at);
        int status = channel.Read(&data[at], static_cast<unsigned int>(n));
        if (status != 0) {
            return status;
        }
    }
    return 0;
}

bool IsCurrentTls(SSL* session) {
    return session != nullptr &&
           (SSL_version(session) == TLS1_2_VERSION || SSL_version(session) == TLS1_3_VERSION);
}

// ---------------------------------------------------------------------------------------------
// Fixture: certificates once per program, the log in a file per test, paths redirected.

class ChannelTlsTest : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        // The program, not the library, decides about SIGPIPE and initialises OpenSSL.
        signal(SIGPIPE, SIG_IGN);
        OPENSSL_init_ssl(OPENSSL_INIT_LOAD_SSL_STRINGS | OPENSSL_INIT_LOAD_CRYPTO_STRINGS, nullptr);
        certs_ = std::make_unique<Certificates>();
    }
    static void TearDownTestSuite() { certs_.reset(); }

    void SetUp() override {
        log_file_ = log_dir_ / "channel.log";
        ASSERT_EQ(S2S::Logger::Initialize(S2S::Logger::File, S2S::Logger::Debug, log_file_, 50), 0);
        UseServerCert("plain");
        Channel::SetVerifyCAPath(certs_->ca_file());
    }

    void TearDown() override {
        S2S::Logger::Destroy();
        Channel::SetCERTPath("/nonexistent/s2s-test.pem");
        Channel::SetPriKeyPath("/nonexistent/s2s-test.key");
        Channel::SetVerifyCAPath("/nonexistent/s2s-ca.pem");
    }

    static void UseServerCert(const std::string& kind) {
        Channel::SetCERTPath(certs_->cert_file(kind));
        Channel::SetPriKeyPath(certs_->key_file(kind));
    }

    std::string Log() const { return s2s_test::ReadFile(log_file_); }
    // Whether `text` was logged at or after byte `from` of the log.
    bool Logged(const std::string& text, size_t from = 0) const {
        return Log().find(text, from) != std::string::npos;
    }
    // Quiet logging for bulk transfers, where per-read debug lines would rotate the file away.
    void QuietLog() {
        S2S::Logger::Destroy();
        ASSERT_EQ(S2S::Logger::Initialize(S2S::Logger::File, S2S::Logger::Warning, log_file_, 50),
                  0);
    }

    static std::unique_ptr<Certificates> certs_;
    TempDir log_dir_{"s2s-tls-log"};
    std::string log_file_;
};

std::unique_ptr<Certificates> ChannelTlsTest::certs_;

// ---------------------------------------------------------------------------------------------
// Host names

TEST(TlsHostNameTest, ExactNamesIgnoreAsciiCaseOnly) {
    using S2S::tls::HostNameMatches;
    EXPECT_TRUE(HostNameMatches("nas.example.lan", "nas.example.lan"));
    EXPECT_TRUE(HostNameMatches("NAS.Example.LAN", "nas.example.lan"));
    EXPECT_FALSE(HostNameMatches("nas.example.lan", "nas.example.lan."));
    EXPECT_FALSE(HostNameMatches("nas.example.lan", "nas.example"));
    EXPECT_FALSE(HostNameMatches("", "nas.example.lan"));
    // Only ASCII letters fold: the UTF-8 bytes of 'Ä' and 'ä' stay different.
    EXPECT_FALSE(HostNameMatches("\xC3\x84.lan", "\xC3\xA4.lan"));
}

TEST(TlsHostNameTest, WildcardCoversTheDomainAndOneLabelBelow) {
    using S2S::tls::HostNameMatches;
    EXPECT_TRUE(HostNameMatches("*.example.lan", "example.lan"));
    EXPECT_TRUE(HostNameMatches("*.example.lan", "nas.example.lan"));
    EXPECT_TRUE(HostNameMatches("*.Example.LAN", "NAS.example.lan"));
    EXPECT_FALSE(HostNameMatches("*.example.lan", "a.nas.example.lan"));
    EXPECT_FALSE(HostNameMatches("*.example.lan", "nasexample.lan"));
    EXPECT_FALSE(HostNameMatches("*.example.lan", "example.lan.evil"));
    EXPECT_FALSE(HostNameMatches("*.example.lan", "lan"));
    // Degenerate patterns never match anything.
    EXPECT_FALSE(HostNameMatches("*", "lan"));
    EXPECT_FALSE(HostNameMatches("*.", "x."));
    EXPECT_FALSE(HostNameMatches("*x.example.lan", "example.lan"));
    EXPECT_FALSE(HostNameMatches("*x.example.lan", "a.example.lan"));
}

TEST(TlsHostNameTest, CertificateNamesCommonNameThenAltNamesAndRejectsEmbeddedNul) {
    using S2S::tls::CertificateMatchesHost;
    KeyPtr key = NewKey();
    CertSpec want;
    want.common_name = "files.example.org";
    want.dns = {std::string("evil.lan\0.example.org", 21), "backup.example.org",
                "*.Store.Example.Org"};
    CertPtr cert = MakeCert(want, key.get(), nullptr, nullptr);
    EXPECT_TRUE(CertificateMatchesHost(cert.get(), "FILES.example.org"));
    EXPECT_TRUE(CertificateMatchesHost(cert.get(), "backup.example.org"));
    EXPECT_TRUE(CertificateMatchesHost(cert.get(), "nas.store.example.org"));
    EXPECT_FALSE(CertificateMatchesHost(cert.get(), "evil.lan"));
    EXPECT_FALSE(CertificateMatchesHost(cert.get(), "other.example.org"));
    EXPECT_FALSE(CertificateMatchesHost(nullptr, "files.example.org"));

    CertSpec forged;
    forged.common_name = std::string("nas.example.lan\0.evil", 21);
    CertPtr forged_cert = MakeCert(forged, key.get(), nullptr, nullptr);
    EXPECT_FALSE(CertificateMatchesHost(forged_cert.get(), "nas.example.lan"));
}

// ---------------------------------------------------------------------------------------------
// Paths

TEST(TlsPathTest, DefaultsAreTheFixedFilesAndSettersReplaceThem) {
    // The defaults are seen only before any setter ran, so they are checked in a fresh run of
    // this program. Only the strings are looked at: nothing here opens the fixed files.
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(
        {
            bool defaults = Channel::GetCertPath() == "/tmp/.cloud_certs" &&
                            Channel::GetKeyPath() == "/tmp/.cloud_server.key" &&
                            Channel::GetCAPath() == "/certs.pem";
            std::exit(defaults ? 0 : 1);
        },
        ::testing::ExitedWithCode(0), "");
    Channel::SetCERTPath("/a/cert.pem");
    Channel::SetPriKeyPath("/a/key.pem");
    Channel::SetVerifyCAPath("/a/ca.pem");
    EXPECT_EQ(Channel::GetCertPath(), "/a/cert.pem");
    EXPECT_EQ(Channel::GetKeyPath(), "/a/key.pem");
    EXPECT_EQ(Channel::GetCAPath(), "/a/ca.pem");
}

// ---------------------------------------------------------------------------------------------
// The library as client against `openssl s_server`: the trust matrix.

struct TrustCase {
    const char* name;
    const char* server_cert;
    bool allow_untrusted;
    const char* host;
    int expected;
};

// Names the case in test listings instead of dumping its bytes.
void PrintTo(const TrustCase& c, std::ostream* out) {
    *out << c.name;
}

class ClientTrustTest : public ChannelTlsTest, public ::testing::WithParamInterface<TrustCase> {};

TEST_P(ClientTrustTest, AgainstOpensslServer) {
    const TrustCase& c = GetParam();
    OpensslServer server(certs_->cert_file(c.server_cert), certs_->key_file(c.server_cert));
    TestChannel channel;
    channel.SetTimeout(20);
    channel.SetAllowUntrust(c.allow_untrusted);
    channel.SetSSLHostname(c.host);
    ASSERT_EQ(channel.Open("127.0.0.1", server.port()), 0);

    EXPECT_EQ(channel.ConvertToSSLChannel(false), c.expected) << Log();
    // The cipher list of old is refused by current OpenSSL: a warning, then the defaults.
    EXPECT_TRUE(Logged("can't set cipher suit to SSL3_TXT_RSA_RC4_128_MD5"));
    if (c.expected == 0) {
        ASSERT_TRUE(channel.IsSSL());
        EXPECT_TRUE(IsCurrentTls(channel.Session())) << SSL_get_version(channel.Session());
        const std::string line = "hello over tls\n";
        ASSERT_EQ(channel.Write(line.data(), line.size()), 0);
        ASSERT_EQ(channel.FlushWrite(0), 0);
        char reply[15];
        ASSERT_EQ(channel.Read(reply, sizeof(reply)), 0);
        EXPECT_EQ(std::string(reply, sizeof(reply)), "slt revo olleh\n");
        const std::string marker = "Client cipher list:";
        ASSERT_TRUE(server.process().WaitUntil([&](const std::string&, const std::string& err) {
            size_t at = err.find(marker);
            return at != std::string::npos && err.find('\n', at) != std::string::npos;
        }));
        // No RC4 offered, and the TLS 1.2 defaults are still there beside the TLS 1.3 suites.
        const std::string err = server.process().Err();
        const size_t list = err.find(marker);
        const std::string offered = err.substr(list, err.find('\n', list) - list);
        EXPECT_EQ(offered.find("RC4"), std::string::npos) << offered;
        EXPECT_NE(offered.find(":ECDHE-"), std::string::npos) << offered;
    } else {
        EXPECT_TRUE(Logged("ConvertToSSLChannel: Verify Fail!"));
        // The plain channel stays open for the caller to close.
        EXPECT_FALSE(channel.IsSSL());
        EXPECT_FALSE(channel.IsClosed());
    }
    channel.Close();
    EXPECT_TRUE(channel.IsClosed());
    EXPECT_TRUE(server.process().Exited());
}

INSTANTIATE_TEST_SUITE_P(
    Matrix, ClientTrustTest,
    ::testing::Values(
        TrustCase{"TrustedNoHost", "plain", false, "", 0},
        TrustCase{"TrustedHostMatchIgnoringCase", "plain", false, "NAS.example.LAN", 0},
        TrustCase{"TrustedHostMismatch", "plain", false, "other.example.lan", -24},
        TrustCase{"WildcardDomainItself", "wildcard", false, "example.lan", 0},
        TrustCase{"WildcardOneLabelBelow", "wildcard", false, "nas.example.lan", 0},
        TrustCase{"WildcardTwoLabelsBelow", "wildcard", false, "a.nas.example.lan", -24},
        TrustCase{"AltNameSecondEntry", "san", false, "nas2.example.org", 0},
        TrustCase{"CommonNameBesideAltNames", "san", false, "files.example.org", 0},
        TrustCase{"AltNameMismatch", "san", false, "other.example.org", -24},
        TrustCase{"ExpiredRefused", "expired", false, "", -24},
        TrustCase{"ExpiredAllowed", "expired", true, "nas.example.lan", 0},
        TrustCase{"SelfSignedRefused", "selfsigned", false, "", -24},
        TrustCase{"SelfSignedRefusedEvenWithMatchingHost", "selfsigned", false, "nas.example.lan",
                  -24},
        TrustCase{"SelfSignedAllowed", "selfsigned", true, "", 0},
        TrustCase{"AllowedSkipsHostCheck", "plain", true, "wrong.example.com", 0}),
    [](const ::testing::TestParamInfo<TrustCase>& info) { return std::string(info.param.name); });

TEST_F(ChannelTlsTest, ClientNegotiatesTls12WithAServerLimitedToIt) {
    OpensslServer server(certs_->cert_file("plain"), certs_->key_file("plain"), {"-tls1_2"});
    TestChannel channel;
    channel.SetAllowUntrust(false);
    channel.SetSSLHostname("nas.example.lan");
    ASSERT_EQ(channel.Open("127.0.0.1", server.port()), 0);
    ASSERT_EQ(channel.ConvertToSSLChannel(false), 0) << Log();
    EXPECT_EQ(SSL_version(channel.Session()), TLS1_2_VERSION);
    ASSERT_EQ(channel.Write("ab\n", 3), 0);
    ASSERT_EQ(channel.FlushWrite(0), 0);
    char reply[3];
    ASSERT_EQ(channel.Read(reply, 3), 0);
    EXPECT_EQ(std::string(reply, 3), "ba\n");
}

// The names of a context's cipher suites, in order.
std::vector<std::string> CipherNames(SSL_CTX* ctx) {
    std::vector<std::string> names;
    STACK_OF(SSL_CIPHER)* ciphers = SSL_CTX_get_ciphers(ctx);
    for (int i = 0; i < sk_SSL_CIPHER_num(ciphers); ++i) {
        names.push_back(SSL_CIPHER_get_name(sk_SSL_CIPHER_value(ciphers, i)));
    }
    return names;
}

TEST_F(ChannelTlsTest, RefusedClientCipherListLeavesTheDefaultsExactly) {
    SSL_CTX* fresh = SSL_CTX_new(TLS_client_method());
    ASSERT_NE(fresh, nullptr);
    const std::vector<std::string> defaults = CipherNames(fresh);
    SSL_CTX_free(fresh);
    SSL* ssl = nullptr;
    SSL_CTX* ctx = nullptr;
    ASSERT_EQ(Channel::InitSSL(ssl, ctx, false, true), 0);
    EXPECT_TRUE(Logged("can't set cipher suit to SSL3_TXT_RSA_RC4_128_MD5\n"));
    EXPECT_EQ(CipherNames(ctx), defaults);
    EXPECT_EQ(ERR_peek_error(), 0u) << "the refusal must not linger in the error queue";
    Channel::DeinitSSL(ssl, ctx, true);
    EXPECT_EQ(ssl, nullptr);
    EXPECT_EQ(ctx, nullptr);
}

TEST_F(ChannelTlsTest, ClientWithoutCaFileFailsSetupAndKeepsThePlainChannel) {
    OpensslServer server(certs_->cert_file("plain"), certs_->key_file("plain"));
    Channel::SetVerifyCAPath(certs_->path("missing-ca.pem"));
    TestChannel channel;
    channel.SetAllowUntrust(false);
    ASSERT_EQ(channel.Open("127.0.0.1", server.port()), 0);
    EXPECT_EQ(channel.ConvertToSSLChannel(false), -2);
    EXPECT_TRUE(
        Logged("SSL_CTX_load_verify_locations(" + certs_->path("missing-ca.pem") + ") failed"));
    EXPECT_TRUE(Logged("InitSSL(): set Verify store fail"));
    EXPECT_TRUE(Logged("Open: init ssl failed"));
    EXPECT_TRUE(Logged("ssl-errors: "));
    EXPECT_FALSE(channel.IsClosed());
    EXPECT_FALSE(channel.IsSSL());
}

// ---------------------------------------------------------------------------------------------
// The library as server against `openssl s_client`.

TEST_F(ChannelTlsTest, ServerIsVerifiedByOpensslClient) {
    const std::pair<const char*, const char*> versions[] = {{"-tls1_3", "TLSv1.3"},
                                                            {"-tls1_2", "TLSv1.2"}};
    for (const auto& [option, version] : versions) {
        SCOPED_TRACE(option);
        Listener listener;
        Child client({"openssl", "s_client", "-connect",
                      "127.0.0.1:" + std::to_string(listener.port()), "-CAfile", certs_->ca_file(),
                      "-verify_return_error", "-verify_hostname", "nas.example.lan", "-brief",
                      option});
        TestChannel channel;
        ASSERT_EQ(AcceptInto(listener, channel), 0);
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0) << Log() << client.Err();
        EXPECT_TRUE(IsCurrentTls(channel.Session()));
        EXPECT_TRUE(Logged("cert path = " + certs_->cert_file("plain")));

        ASSERT_TRUE(client.WaitOutput("Verification: OK", true)) << client.Err();
        EXPECT_NE(client.Err().find(std::string("Protocol version: ") + version), std::string::npos)
            << client.Err();

        client.Send("ping\n");
        char got[5];
        ASSERT_EQ(channel.Read(got, 5), 0);
        EXPECT_EQ(std::string(got, 5), "ping\n");
        ASSERT_EQ(channel.Write("pong\n", 5), 0);
        ASSERT_EQ(channel.FlushWrite(0), 0);
        EXPECT_TRUE(client.WaitOutput("pong\n"));
        channel.Close();
        EXPECT_TRUE(client.Exited());
    }
}

TEST_F(ChannelTlsTest, LargeTransferBothWaysWithOpensslClient) {
    QuietLog();
    TempDir data_dir("s2s-tls-data");
    const std::string upload = RandomBytes(3 * 1024 * 1024 + 4321, 7);
    const std::string download = RandomBytes(5 * 1024 * 1024 + 17, 8);
    s2s_test::WriteFile(data_dir / "upload", upload);
    Listener listener;
    // -quiet keeps standard output free of session details and keeps the client reading after
    // its input ends, until the server closes.
    Child client({"openssl", "s_client", "-connect", "127.0.0.1:" + std::to_string(listener.port()),
                  "-quiet"},
                 data_dir / "upload");
    TestChannel channel;
    channel.SetTimeout(30);
    ASSERT_EQ(AcceptInto(listener, channel), 0);
    ASSERT_EQ(channel.ConvertToSSLChannel(true), 0) << Log() << client.Err();
    std::string received;
    ASSERT_EQ(ReadAll(channel, upload.size(), 65536 + 3, received), 0);
    EXPECT_TRUE(received == upload);
    ASSERT_EQ(WriteAll(channel, download, 81920), 0);
    channel.Close();
    ASSERT_TRUE(client.Exited(60s));
    EXPECT_EQ(client.Out().size(), download.size());
    EXPECT_TRUE(client.Out() == download);
}

TEST_F(ChannelTlsTest, ServerSetupFailuresReportTheFileAndKeepThePlainChannel) {
    struct Setup {
        std::string cert;
        std::string key;
        std::vector<std::string> messages;
    };
    const std::vector<Setup> setups = {
        {certs_->path("missing.pem"),
         certs_->key_file("plain"),
         {"Install certificate failed", "Open: init ssl certificate failed"}},
        {certs_->cert_file("plain"),
         certs_->path("missing.key"),
         {"Install private key failed", "Open: init ssl private key failed"}},
        // A key of another certificate, and a key under a pass phrase (which must fail at once
        // rather than prompt on a terminal).
        {certs_->cert_file("plain"),
         certs_->path("stray.key"),
         {"Install private key failed", "Open: init ssl private key failed"}},
        {certs_->cert_file("plain"),
         certs_->path("locked.key"),
         {"Install private key failed", "Open: init ssl private key failed"}},
    };
    for (const Setup& setup : setups) {
        SCOPED_TRACE(setup.cert + " " + setup.key);
        const size_t mark = Log().size();
        Channel::SetCERTPath(setup.cert);
        Channel::SetPriKeyPath(setup.key);
        Listener listener;
        int peer = ConnectRaw(listener.port());
        ASSERT_GE(peer, 0);
        TestChannel channel;
        ASSERT_EQ(AcceptInto(listener, channel), 0);
        EXPECT_EQ(channel.ConvertToSSLChannel(true), -2);
        for (const std::string& message : setup.messages) {
            EXPECT_TRUE(Logged(message, mark)) << message;
        }
        EXPECT_TRUE(Logged("Open: init ssl failed", mark));
        EXPECT_TRUE(Logged("ssl-errors: ", mark));
        EXPECT_EQ(Log().find("not-for-the-log"), std::string::npos);
        // Nothing went over the wire: both sides can still talk in the clear.
        ASSERT_EQ(channel.Write("plain", 5), 0);
        ASSERT_EQ(channel.FlushWrite(0), 0);
        char got[5];
        ASSERT_EQ(recv(peer, got, 5, MSG_WAITALL), 5);
        EXPECT_EQ(std::string(got, 5), "plain");
        ASSERT_EQ(send(peer, "reply", 5, 0), 5);
        ASSERT_EQ(channel.Read(got, 5), 0);
        EXPECT_EQ(std::string(got, 5), "reply");
        close(peer);
    }
}

TEST_F(ChannelTlsTest, RefusingServerNeedsAClientCertificateOnlyWhenAHostIsExpected) {
    for (const char* host : {"", "client.example.lan"}) {
        SCOPED_TRACE(host);
        Listener listener;
        Child client({"openssl", "s_client", "-connect",
                      "127.0.0.1:" + std::to_string(listener.port()), "-brief"});
        TestChannel channel;
        channel.SetAllowUntrust(false);
        channel.SetSSLHostname(host);
        ASSERT_EQ(AcceptInto(listener, channel), 0);
        // No client certificate is asked for: nothing fails verification, but there is no
        // certificate to carry the expected name either.
        EXPECT_EQ(channel.ConvertToSSLChannel(true), *host == '\0' ? 0 : -24) << Log();
        channel.Close();
        EXPECT_TRUE(client.Exited());
    }
}

// ---------------------------------------------------------------------------------------------
// The library on both ends.

// Runs the library's server side of one connection in a thread.
template <typename Body>
std::future<void> ServeOnce(Listener& listener, Body body) {
    return std::async(std::launch::async, [&listener, body]() mutable {
        TestChannel server;
        server.SetTimeout(20);
        ASSERT_EQ(AcceptInto(listener, server), 0);
        body(server);
    });
}

TEST_F(ChannelTlsTest, LargeTransferBothWaysBetweenLibraryChannels) {
    QuietLog();
    const std::string upload = RandomBytes(8 * 1024 * 1024 + 3, 1);
    const std::string download = RandomBytes(6 * 1024 * 1024 + 11, 2);
    // A small ring on one side and the IPC size on the other, with pieces that never line up
    // with either, so both rings wrap at every possible offset.
    Listener listener;
    std::string server_got;
    auto server = ServeOnce(listener, [&](TestChannel& channel) {
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0);
        ASSERT_EQ(ReadAll(channel, upload.size(), 5000, server_got), 0);
        ASSERT_EQ(WriteAll(channel, download, 81920), 0);
        std::string ack;
        ASSERT_EQ(ReadAll(channel, 3, 3, ack), 0);
        EXPECT_EQ(ack, "ack");
    });
    TestChannel client(4099);
    client.SetTimeout(20);
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0);
    ASSERT_EQ(WriteAll(client, upload, 4099), 0);
    std::string client_got;
    ASSERT_EQ(ReadAll(client, download.size(), 70001, client_got), 0);
    ASSERT_EQ(WriteAll(client, "ack", 3), 0);
    server.get();
    EXPECT_TRUE(server_got == upload);
    EXPECT_TRUE(client_got == download);
    EXPECT_FALSE(Logged("ssl-errors")) << Log();
}

TEST_F(ChannelTlsTest, BufferedBytesCrossTheConversion) {
    Listener listener;
    auto server = ServeOnce(listener, [&](TestChannel& channel) {
        // In the clear first; the client buffers more than it consumes.
        ASSERT_EQ(channel.Write("0123456789", 10), 0);
        ASSERT_EQ(channel.FlushWrite(0), 0);
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0);
        char early[5];
        ASSERT_EQ(channel.Read(early, 5), 0);
        EXPECT_EQ(std::string(early, 5), "early");
        ASSERT_EQ(channel.Write("later", 5), 0);
        ASSERT_EQ(channel.FlushWrite(0), 0);
    });
    TestChannel client;
    client.SetTimeout(20);
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    char head[4];
    ASSERT_EQ(client.Read(head, 4), 0);
    ASSERT_EQ(client.BufferedRead(), 6u) << "the ten plain bytes arrive in one segment";
    // Written before the conversion, sent after it, encrypted.
    ASSERT_EQ(client.Write("early", 5), 0);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0);
    EXPECT_EQ(client.BufferedWrite(), 5u);
    ASSERT_EQ(client.FlushWrite(0), 0);
    char rest[6];
    ASSERT_EQ(client.Read(rest, 6), 0);
    EXPECT_EQ(std::string(rest, 6), "456789");
    char later[5];
    ASSERT_EQ(client.Read(later, 5), 0);
    EXPECT_EQ(std::string(later, 5), "later");
    server.get();
}

TEST_F(ChannelTlsTest, SecondConversionWarnsAndChangesNothing) {
    Listener listener;
    auto server = ServeOnce(listener, [&](TestChannel& channel) {
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0);
        char got[2];
        ASSERT_EQ(channel.Read(got, 2), 0);
        ASSERT_EQ(channel.Write(got, 2), 0);
        ASSERT_EQ(channel.FlushWrite(0), 0);
    });
    TestChannel client;
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0);
    SSL* session = client.Session();
    EXPECT_EQ(client.ConvertToSSLChannel(false), 0);
    EXPECT_TRUE(Logged("ConvertToSSLChannel: Channel is SSL channel, no need to be converted"));
    EXPECT_EQ(client.Session(), session);
    ASSERT_EQ(client.Write("ok", 2), 0);
    ASSERT_EQ(client.FlushWrite(0), 0);
    char got[2];
    ASSERT_EQ(client.Read(got, 2), 0);
    EXPECT_EQ(std::string(got, 2), "ok");
    server.get();
}

TEST_F(ChannelTlsTest, CloseEndsTheSessionAndTheChannelOpensPlainAgain) {
    Listener listener;
    auto server = ServeOnce(listener, [&](TestChannel& channel) {
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0);
        char got[4];
        ASSERT_EQ(channel.Read(got, 4), 0);
        // The client's close-notify (then end of stream) ends the next read.
        EXPECT_EQ(channel.Read(got, 1), -2);
    });
    TestChannel client;
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0);
    ASSERT_EQ(client.Write("bye!", 4), 0);
    client.Close();  // flushes the four bytes first
    EXPECT_TRUE(client.IsClosed());
    EXPECT_FALSE(client.IsSSL());
    EXPECT_TRUE(Logged("destroy ssl obj"));
    EXPECT_TRUE(Logged("Channel: socket "));
    server.get();

    Listener plain;
    int peer = -1;
    std::thread accept([&] { peer = plain.Accept(); });
    ASSERT_EQ(client.Open("127.0.0.1", plain.port()), 0);
    accept.join();
    ASSERT_GE(peer, 0);
    ASSERT_EQ(client.Write("clear", 5), 0);
    ASSERT_EQ(client.FlushWrite(0), 0);
    char got[5];
    ASSERT_EQ(recv(peer, got, 5, MSG_WAITALL), 5);
    EXPECT_EQ(std::string(got, 5), "clear");
    close(peer);
}

TEST_F(ChannelTlsTest, ConvertingAClosedChannelFailsToBind) {
    TestChannel channel;
    EXPECT_EQ(channel.ConvertToSSLChannel(false), -2);
    EXPECT_TRUE(Logged("set fd failed"));
    EXPECT_TRUE(channel.IsClosed());
}

TEST_F(ChannelTlsTest, AbortFlagStopsTlsReadsButNotTheHandshake) {
    Listener listener;
    std::promise<void> finished;
    auto server = ServeOnce(listener, [&](TestChannel& channel) {
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0);
        finished.get_future().wait();
    });
    int abort = 1;
    TestChannel client;
    client.SetTimeout(20);
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    client.SetFlag(&abort);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0);
    char byte;
    EXPECT_EQ(client.Read(&byte, 1), -1);
    finished.set_value();
    server.get();
}

// ---------------------------------------------------------------------------------------------
// Peers that misbehave.

TEST_F(ChannelTlsTest, SilentServerIsGivenUpAfterTheTimeoutWhateverTheAbortFlag) {
    Listener listener;  // completes the TCP handshake, never answers the TLS one
    int abort = 1;
    TestChannel client;
    client.SetTimeout(2);
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    client.SetFlag(&abort);
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(client.ConvertToSSLChannel(false), -2);
    auto took = std::chrono::steady_clock::now() - start;
    EXPECT_GE(took, 1900ms);
    EXPECT_LT(took, 8s);
    EXPECT_TRUE(Logged("SSLHandshake: timed out during connect (2 seconds), abort anyway"));
    EXPECT_TRUE(Logged("Open to SSL connect to server failed"));
    EXPECT_FALSE(client.IsClosed());
    EXPECT_FALSE(client.IsSSL());
}

TEST_F(ChannelTlsTest, SilentClientIsGivenUpAfterTheTimeout) {
    Listener listener;
    int peer = ConnectRaw(listener.port());
    ASSERT_GE(peer, 0);
    TestChannel server;
    server.SetTimeout(2);
    ASSERT_EQ(AcceptInto(listener, server), 0);
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(server.ConvertToSSLChannel(true), -2);
    EXPECT_GE(std::chrono::steady_clock::now() - start, 1900ms);
    EXPECT_TRUE(Logged("SSLHandshake: timed out during connect (2 seconds), abort anyway"));
    close(peer);
}

TEST_F(ChannelTlsTest, PeerSpeakingPlainTextFailsTheHandshake) {
    Listener listener;
    std::thread peer([&] {
        int fd = listener.Accept();
        char hello[64];
        recv(fd, hello, sizeof(hello), 0);  // the client hello
        const char answer[] = "HTTP/1.0 400 Bad Request\r\n\r\n";
        send(fd, answer, sizeof(answer) - 1, 0);
        close(fd);
    });
    TestChannel client;
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    EXPECT_EQ(client.ConvertToSSLChannel(false), -2);
    peer.join();
    EXPECT_TRUE(Logged("SSLHandshake: SSL fatel error code: 1\n")) << Log();
    EXPECT_TRUE(Logged("ssl-errors: "));
    EXPECT_TRUE(Logged("Open to SSL connect to server failed"));
}

// A raw OpenSSL server that completes the handshake, then sends one whole record and only the
// first half of the next, pauses, and closes the connection.
TEST_F(ChannelTlsTest, PeerClosingMidRecordDeliversTheWholeRecordsOnly) {
    Listener listener;
    std::promise<void> half_sent;
    std::promise<void> may_close;
    std::thread peer([&] {
        SSL_CTX* ctx = SSL_CTX_new(TLS_server_method());
        SSL_CTX_use_certificate_chain_file(ctx, certs_->cert_file("plain").c_str());
        SSL_CTX_use_PrivateKey_file(ctx, certs_->key_file("plain").c_str(), SSL_FILETYPE_PEM);
        SSL_CTX_set_num_tickets(ctx, 0);
        int fd = listener.Accept();
        SSL* ssl = SSL_new(ctx);
        SSL_set_fd(ssl, fd);
        if (SSL_accept(ssl) == 1) {
            // From here on records are built in memory and put on the wire by hand.
            BIO* records = BIO_new(BIO_s_mem());
            SSL_set0_wbio(ssl, records);
            auto take = [records] {
                std::string bytes(static_cast<size_t>(BIO_pending(records)), '\0');
                BIO_read(records, bytes.data(), static_cast<int>(bytes.size()));
                return bytes;
            };
            SSL_write(ssl, "whole", 5);
            const std::string whole = take();
            send(fd, whole.data(), whole.size(), 0);
            const std::string payload(1000, 'x');
            SSL_write(ssl, payload.data(), static_cast<int>(payload.size()));
            const std::string cut = take();
            send(fd, cut.data(), cut.size() / 2, 0);
        }
        half_sent.set_value();
        may_close.get_future().wait();
        close(fd);
        SSL_free(ssl);
        SSL_CTX_free(ctx);
    });
    TestChannel client;
    client.SetTimeout(2);
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0) << Log();
    half_sent.get_future().wait();

    // Half a record is no data: the read waits it out as quiet intervals.
    char got[1005];
    unsigned int count = 0;
    EXPECT_EQ(client.Read(got, sizeof(got), count), -9);
    EXPECT_EQ(count, 5u);
    EXPECT_EQ(std::string(got, 5), "whole");
    EXPECT_TRUE(Logged("SSL want read"));
    EXPECT_TRUE(Logged("ReadMore: Channel timeout for 2 seconed"));

    may_close.set_value();
    peer.join();
    client.ClearRead();
    EXPECT_EQ(client.Read(got, 1000, count), -2);
    EXPECT_EQ(count, 0u);
    EXPECT_TRUE(Logged("ssl-errors: "));
}

}  // namespace
