// TLS channels. One table of configurations (certificate kind, trust, expected host, protocol)
// against each kind of peer: the library's own other side, `openssl s_server` and `openssl
// s_client`. Then the channel's own rules: host-name matching, the fixed certificate paths, the
// refused legacy cipher list, setup failures that keep the plain channel, bytes buffered across
// the conversion, a second conversion and closing, the abort flag, and peers that misbehave
// (silent, plain text, closing mid-record). Certificates are made at run time; the fixed paths
// are always redirected through the setters.
#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>
#include <poll.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <future>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include "net/tls_host_match.h"
#include "s2s_channel.h"
#include "support/test_util.h"

namespace {

using S2S::Channel;
using s2s_test::TempDir;
using namespace std::chrono_literals;

// ---- Certificates

using KeyPtr = std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)>;
using CertPtr = std::unique_ptr<X509, decltype(&X509_free)>;

struct CertSpec {
    std::string common_name;            // may hold an embedded NUL
    std::vector<std::string> dns = {};  // subject alternative names, in order; may hold NULs
    long valid_from = -3600;            // seconds relative to now
    long valid_until = 86400;
    bool ca = false;
};

KeyPtr NewKey() {
    return KeyPtr(EVP_EC_gen("P-256"), EVP_PKEY_free);
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
    X509_NAME_add_entry_by_txt(X509_get_subject_name(cert.get()), "CN", MBSTRING_UTF8,
                               reinterpret_cast<const unsigned char*>(want.common_name.data()),
                               static_cast<int>(want.common_name.size()), -1, 0);
    X509* signer = issuer != nullptr ? issuer : cert.get();
    X509_set_issuer_name(cert.get(), X509_get_subject_name(signer));
    for (const auto& [nid, value] :
         {std::pair<int, const char*>{NID_basic_constraints,
                                      want.ca ? "critical,CA:TRUE" : "critical,CA:FALSE"},
          {NID_key_usage, want.ca ? "critical,keyCertSign,cRLSign" : "critical,digitalSignature"},
          {NID_subject_key_identifier, "hash"}}) {
        X509V3_CTX ctx;
        X509V3_set_ctx(&ctx, signer, cert.get(), nullptr, nullptr, 0);
        X509_EXTENSION* ext = X509V3_EXT_conf_nid(nullptr, &ctx, nid, value);
        X509_add_ext(cert.get(), ext, -1);
        X509_EXTENSION_free(ext);
    }
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

// A CA, server certificates of every kind it signs, and a self-signed one, in a private
// directory: "<kind>.pem" (leaf then CA) and "<kind>.key" (0600). Also a key of no certificate
// here, and the plain key under a pass phrase.
class Certificates {
  public:
    Certificates() {
        KeyPtr ca_key = NewKey();
        CertSpec ca_spec{"s2s test CA", {}, -3600, 86400, true};
        CertPtr ca = MakeCert(ca_spec, ca_key.get(), nullptr, nullptr);
        WritePem(ca_file(), {ca.get()});
        const CertSpec plain{"nas.example.lan"};
        const std::pair<std::string, CertSpec> kinds[] = {
            {"plain", plain},
            {"wildcard", {"*.Example.LAN"}},
            {"san", {"files.example.org", {"backup.example.org", "NAS2.Example.Org"}}},
            {"expired", {"nas.example.lan", {}, -2 * 86400, -86400}},
            {"selfsigned", plain}};
        for (const auto& [kind, spec] : kinds) {
            KeyPtr key = NewKey();
            const bool self = kind == "selfsigned";
            CertPtr cert =
                MakeCert(spec, key.get(), self ? nullptr : ca.get(), self ? nullptr : ca_key.get());
            WritePem(cert_file(kind), self ? std::vector<X509*>{cert.get()}
                                           : std::vector<X509*>{cert.get(), ca.get()});
            WriteKey(key_file(kind), key.get());
            if (kind == "plain") {
                WriteKey(path("locked.key"), key.get(), "not-for-the-log");
            }
        }
        WriteKey(path("stray.key"), NewKey().get());
    }

    std::string ca_file() const { return dir_ / "ca.pem"; }
    std::string cert_file(const std::string& kind) const { return dir_ / (kind + ".pem"); }
    std::string key_file(const std::string& kind) const { return dir_ / (kind + ".key"); }
    std::string path(const std::string& name) const { return dir_ / name; }

  private:
    static void WritePem(const std::string& path, const std::vector<X509*>& chain) {
        FILE* file = std::fopen(path.c_str(), "w");
        for (X509* cert : chain) {
            PEM_write_X509(file, cert);
        }
        std::fclose(file);
    }
    static void WriteKey(const std::string& path, EVP_PKEY* key, const char* pass = nullptr) {
        FILE* file =
            fdopen(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600), "w");
        PEM_write_PrivateKey(file, key, pass != nullptr ? EVP_aes_256_cbc() : nullptr,
                             reinterpret_cast<unsigned char*>(const_cast<char*>(pass)),
                             pass != nullptr ? static_cast<int>(std::strlen(pass)) : 0, nullptr,
                             nullptr);
        std::fclose(file);
    }

    TempDir dir_{"s2s-tls-certs"};
};

// ---- Peers and sockets

// An `openssl` process. Its output goes to files, so it never blocks on a full pipe; its
// standard input is a pipe.
class Openssl {
  public:
    explicit Openssl(const std::vector<std::string>& args) : args_(args) {
        for (std::string& arg : args_) {
            argv_.push_back(arg.data());
        }
        argv_.push_back(nullptr);
        const std::string out = dir_ / "out", err = dir_ / "err";
        if (pipe2(in_, O_CLOEXEC) != 0) {
            throw std::runtime_error("pipe2");
        }
        child_.emplace([&] {  // between fork and exec: system calls only
            int o = open(out.c_str(), O_WRONLY | O_CREAT, 0600);
            int e = open(err.c_str(), O_WRONLY | O_CREAT, 0600);
            if (o < 0 || e < 0 || dup2(in_[0], 0) < 0 || dup2(o, 1) < 0 || dup2(e, 2) < 0) {
                return 126;
            }
            execvp(argv_[0], argv_.data());
            return 127;
        });
        close(in_[0]);
    }
    ~Openssl() { CloseStdin(); }

    void Send(const std::string& bytes) {
        ASSERT_EQ(write(in_[1], bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    }
    void CloseStdin() {
        if (in_[1] >= 0) {
            close(std::exchange(in_[1], -1));
        }
    }
    std::string Out() const { return s2s_test::ReadFile(dir_ / "out"); }
    std::string Err() const { return s2s_test::ReadFile(dir_ / "err"); }
    // Waits until `text` shows on standard output (or standard error), a whole line.
    bool WaitFor(const std::string& text, bool on_err = false) const {
        return s2s_test::WaitFor(
            [&] {
                const std::string all = on_err ? Err() : Out();
                const size_t at = all.find(text);
                return at != std::string::npos && all.find('\n', at) != std::string::npos;
            },
            20s);
    }
    // The exit code; -2 when it still ran after 20 seconds.
    int Wait() { return child_->Wait(20s); }

  private:
    TempDir dir_{"s2s-openssl"};
    std::vector<std::string> args_;
    std::vector<char*> argv_;
    int in_[2] = {-1, -1};
    std::optional<s2s_test::Child> child_;
};

// `openssl s_server` answering one connection, reversing each line it receives.
struct OpensslServer : Openssl {
    OpensslServer(const std::string& kind, const std::string& dir, const char* option)
        : Openssl({"openssl", "s_server", "-accept", "127.0.0.1:0", "-cert", dir + kind + ".pem",
                   "-key", dir + kind + ".key", "-naccept", "1", "-rev", option}) {
        if (!WaitFor("ACCEPT 127.0.0.1:")) {
            throw std::runtime_error("s_server did not start: " + Err());
        }
        port = std::stoi(Out().substr(Out().find("ACCEPT 127.0.0.1:") + 17));
    }
    int port = 0;
};

// A listening TCP socket on 127.0.0.1 with a kernel-chosen port.
class Listener {
  public:
    Listener() {
        sockaddr_in addr{AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}};
        socklen_t len = sizeof(addr);
        if (bind(fd_, reinterpret_cast<sockaddr*>(&addr), len) != 0 || listen(fd_, 8) != 0 ||
            getsockname(fd_, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
            throw std::runtime_error("listener");
        }
        port_ = ntohs(addr.sin_port);
    }
    ~Listener() { close(fd_); }
    int port() const { return port_; }
    // A connected socket, or -1 when nobody came within 20 seconds.
    int Accept() {
        pollfd pfd = {fd_, POLLIN, 0};
        return poll(&pfd, 1, 20000) == 1 ? accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC) : -1;
    }
    // A plain connection to it.
    int Connect() const {
        int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in addr{
            AF_INET, htons(static_cast<uint16_t>(port_)), {htonl(INADDR_LOOPBACK)}, {}};
        return connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0 ? fd : -1;
    }

  private:
    int fd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    int port_ = 0;
};

// Reaches the session behind a TLS channel.
class TestChannel : public Channel {
  public:
    explicit TestChannel(unsigned int capacity = 81920) : Channel(capacity) { SetTimeout(20); }
    SSL* Session() const { return is_ssl_ ? static_cast<SSL*>(handle_) : nullptr; }
    bool IsSSL() const { return is_ssl_; }
    unsigned int BufferedRead() const { return r_size_; }
    unsigned int BufferedWrite() const { return w_size_; }
    // The library accepting one connection from `listener`.
    int Accept(Listener& listener) {
        int fd = listener.Accept();
        int status = fd < 0 ? -100 : Open(fd, true);
        if (status != 0 && fd >= 0) {
            close(fd);
        }
        return status;
    }
    int Send(const std::string& data, size_t piece = 81920) {
        for (size_t at = 0; at < data.size(); at += piece) {
            const auto n = static_cast<unsigned int>(std::min(piece, data.size() - at));
            if (int status = Write(data.data() + at, n); status != 0) {
                return status;
            }
        }
        return FlushWrite(0);
    }
    // `size` bytes read in pieces of `piece`; "<status N>" on failure.
    std::string Receive(size_t size, size_t piece = 81920) {
        std::string data(size, '\0');
        for (size_t at = 0; at < size; at += piece) {
            const auto n = static_cast<unsigned int>(std::min(piece, size - at));
            if (int status = Read(&data[at], n); status != 0) {
                return "<status " + std::to_string(status) + ">";
            }
        }
        return data;
    }
};

// The library's server side of one connection, in a thread.
template <typename Body>
std::future<void> ServeOnce(Listener& listener, Body body) {
    return std::async(std::launch::async, [&listener, body]() mutable {
        TestChannel server;
        ASSERT_EQ(server.Accept(listener), 0);
        body(server);
    });
}

std::string RandomBytes(size_t size, unsigned seed) {
    std::mt19937 generator(seed);
    std::string bytes(size, '\0');
    for (char& c : bytes) {
        c = static_cast<char>(generator());
    }
    return bytes;
}

// Certificates once per program, the log captured per test, the paths redirected.
class Tls : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        signal(SIGPIPE, SIG_IGN);  // the program decides, not the library
        certs_ = std::make_unique<Certificates>();
    }
    static void TearDownTestSuite() { certs_.reset(); }
    void SetUp() override {
        UseServerCert("plain");
        Channel::SetVerifyCAPath(certs_->ca_file());
    }
    void TearDown() override {
        Channel::SetCERTPath("/nonexistent/s2s-test.pem");
        Channel::SetPriKeyPath("/nonexistent/s2s-test.key");
        Channel::SetVerifyCAPath("/nonexistent/s2s-ca.pem");
    }
    static void UseServerCert(const std::string& kind) {
        Channel::SetCERTPath(certs_->cert_file(kind));
        Channel::SetPriKeyPath(certs_->key_file(kind));
    }
    bool Logged(const std::string& text) const { return log_->Contains(text); }
    // Bulk transfers log less: per-read debug lines would rotate the file away.
    void QuietLog() { log_.emplace(S2S::Logger::Warning); }

    static std::unique_ptr<Certificates> certs_;
    std::optional<s2s_test::LogCapture> log_{std::in_place};
};

std::unique_ptr<Certificates> Tls::certs_;

// In a plain run of the program this runs first, before any setter.
TEST(TlsPaths, DefaultsAreTheFixedFilesAndSettersReplaceThem) {
    EXPECT_EQ(Channel::GetCertPath(), "/tmp/.cloud_certs");
    EXPECT_EQ(Channel::GetKeyPath(), "/tmp/.cloud_server.key");
    EXPECT_EQ(Channel::GetCAPath(), "/certs.pem");
    Channel::SetCERTPath("/a/cert.pem");
    Channel::SetPriKeyPath("/a/key.pem");
    Channel::SetVerifyCAPath("/a/ca.pem");
    EXPECT_EQ(Channel::GetCertPath() + Channel::GetKeyPath() + Channel::GetCAPath(),
              "/a/cert.pem/a/key.pem/a/ca.pem");
}

TEST(TlsHostName, NamesMatchByTheWildcardAndCaseRulesAndForgedNamesNever) {
    const std::tuple<const char*, const char*, bool> names[] = {
        {"nas.example.lan", "nas.example.lan", true},
        {"NAS.Example.LAN", "nas.example.lan", true},
        {"nas.example.lan", "nas.example.lan.", false},
        {"nas.example.lan", "nas.example", false},
        {"", "nas.example.lan", false},
        {"\xC3\x84.lan", "\xC3\xA4.lan", false},  // only ASCII letters fold
        {"*.example.lan", "example.lan", true},
        {"*.Example.LAN", "NAS.example.lan", true},
        {"*.example.lan", "a.nas.example.lan", false},
        {"*.example.lan", "nasexample.lan", false},
        {"*.example.lan", "example.lan.evil", false},
        {"*.example.lan", "lan", false},
        {"*", "lan", false},
        {"*.", "x.", false},
        {"*x.example.lan", "example.lan", false},
        {"*x.example.lan", "a.example.lan", false},
    };
    for (const auto& [pattern, host, match] : names) {
        EXPECT_EQ(match, S2S::tls::HostNameMatches(pattern, host)) << pattern << " " << host;
    }
    using S2S::tls::CertificateMatchesHost;
    KeyPtr key = NewKey();
    CertPtr cert = MakeCert(
        {"files.example.org",
         {std::string("evil.lan\0.example.org", 21), "backup.example.org", "*.Store.Example.Org"}},
        key.get(), nullptr, nullptr);
    EXPECT_TRUE(CertificateMatchesHost(cert.get(), "FILES.example.org"));
    EXPECT_TRUE(CertificateMatchesHost(cert.get(), "backup.example.org"));
    EXPECT_TRUE(CertificateMatchesHost(cert.get(), "nas.store.example.org"));
    EXPECT_FALSE(CertificateMatchesHost(cert.get(), "evil.lan"));
    EXPECT_FALSE(CertificateMatchesHost(cert.get(), "other.example.org"));
    EXPECT_FALSE(CertificateMatchesHost(nullptr, "files.example.org"));
    CertPtr forged =
        MakeCert({std::string("nas.example.lan\0.evil", 21)}, key.get(), nullptr, nullptr);
    EXPECT_FALSE(CertificateMatchesHost(forged.get(), "nas.example.lan"));
}

// ---- The table: configurations x peers

enum class Peer { kOwnSide, kSServer, kSClient };

struct TlsCase {
    const char* name;
    Peer peer;
    const char* cert;  // the server's certificate kind
    bool allow_untrusted;
    const char* host;    // the name the library expects of its peer
    const char* option;  // of the openssl peer: the protocol
    int expected;        // of ConvertToSSLChannel
};

class TlsMatrix : public Tls, public ::testing::WithParamInterface<TlsCase> {};

TEST_P(TlsMatrix, ConversionAndTrafficAgainstThePeer) {
    const TlsCase& c = GetParam();
    UseServerCert(c.cert);
    TestChannel channel;
    channel.SetAllowUntrust(c.allow_untrusted);
    channel.SetSSLHostname(c.host);
    if (c.peer == Peer::kSServer) {  // the library is the client
        OpensslServer server(c.cert, certs_->path(""), c.option);
        ASSERT_EQ(channel.Open("127.0.0.1", server.port), 0);
        EXPECT_EQ(channel.ConvertToSSLChannel(false), c.expected) << log_->Text();
        // The cipher list of old is refused by current OpenSSL: a warning, then the defaults.
        EXPECT_TRUE(Logged("can't set cipher suit to SSL3_TXT_RSA_RC4_128_MD5"));
        if (c.expected == 0) {
            const int version =
                std::string(c.option) == "-tls1_2" ? TLS1_2_VERSION : TLS1_3_VERSION;
            EXPECT_EQ(version, SSL_version(channel.Session()));
            ASSERT_EQ(channel.Send("hello over tls\n"), 0);
            EXPECT_EQ("slt revo olleh\n", channel.Receive(15));
            // No RC4 offered, and the TLS 1.2 defaults are still there beside the 1.3 suites.
            ASSERT_TRUE(server.WaitFor("Client cipher list:", true));
            const std::string err = server.Err();
            const std::string offered = err.substr(err.find("Client cipher list:"));
            EXPECT_EQ(offered.substr(0, offered.find('\n')).find("RC4"), std::string::npos);
            EXPECT_NE(offered.substr(0, offered.find('\n')).find(":ECDHE-"), std::string::npos);
        }
        channel.Close();
        EXPECT_EQ(0, server.Wait());
    } else if (c.peer == Peer::kSClient) {  // the library is the server
        Listener listener;
        Openssl client({"openssl", "s_client", "-connect",
                        "127.0.0.1:" + std::to_string(listener.port()), "-CAfile",
                        certs_->ca_file(), "-verify_return_error", "-verify_hostname",
                        "nas.example.lan", "-brief", c.option});
        ASSERT_EQ(channel.Accept(listener), 0);
        EXPECT_EQ(channel.ConvertToSSLChannel(true), c.expected) << log_->Text() << client.Err();
        if (c.expected == 0) {
            EXPECT_TRUE(Logged("cert path = " + certs_->cert_file(c.cert)));
            ASSERT_TRUE(client.WaitFor("Verification: OK", true)) << client.Err();
            const std::string version = c.option == std::string("-tls1_2") ? "TLSv1.2" : "TLSv1.3";
            EXPECT_NE(client.Err().find("Protocol version: " + version), std::string::npos);
            client.Send("ping\n");
            EXPECT_EQ("ping\n", channel.Receive(5));
            ASSERT_EQ(channel.Send("pong\n"), 0);
            EXPECT_TRUE(client.WaitFor("pong"));
        }
        channel.Close();
        EXPECT_NE(-2, client.Wait());
    } else {  // the library on both ends
        Listener listener;
        auto server = ServeOnce(listener, [](TestChannel& s) {
            if (s.ConvertToSSLChannel(true) == 0) {
                s.Send(s.Receive(2));
            }
        });
        ASSERT_EQ(channel.Open("127.0.0.1", listener.port()), 0);
        EXPECT_EQ(channel.ConvertToSSLChannel(false), c.expected) << log_->Text();
        if (c.expected == 0) {
            ASSERT_EQ(channel.Send("ok"), 0);
            EXPECT_EQ("ok", channel.Receive(2));
        }
        channel.Close();
        server.get();
    }
    if (c.expected != 0) {  // a refused peer leaves a plain channel for the caller to close
        EXPECT_TRUE(Logged("ConvertToSSLChannel: Verify Fail!"));
    }
}

INSTANTIATE_TEST_SUITE_P(
    , TlsMatrix,
    ::testing::Values(
        TlsCase{"OwnTrustedHostMatch", Peer::kOwnSide, "plain", false, "nas.example.lan", "", 0},
        TlsCase{"OwnHostMismatch", Peer::kOwnSide, "plain", false, "other.example.lan", "", -24},
        TlsCase{"OwnSelfSignedRefused", Peer::kOwnSide, "selfsigned", false, "", "", -24},
        TlsCase{"OwnSelfSignedAllowed", Peer::kOwnSide, "selfsigned", true, "", "", 0},
        TlsCase{"OwnAltNameSecondEntry", Peer::kOwnSide, "san", false, "nas2.example.org", "", 0},
        TlsCase{"OwnExpiredRefused", Peer::kOwnSide, "expired", false, "", "", -24},
        TlsCase{"ServerTrustedNoHost", Peer::kSServer, "plain", false, "", "-tls1_3", 0},
        TlsCase{"ServerHostIgnoringCase", Peer::kSServer, "plain", false, "NAS.example.LAN",
                "-tls1_3", 0},
        TlsCase{"ServerTls12Only", Peer::kSServer, "plain", false, "nas.example.lan", "-tls1_2", 0},
        TlsCase{"ServerWildcardDomainItself", Peer::kSServer, "wildcard", false, "example.lan",
                "-tls1_3", 0},
        TlsCase{"ServerWildcardTwoLabelsBelow", Peer::kSServer, "wildcard", false,
                "a.nas.example.lan", "-tls1_3", -24},
        TlsCase{"ServerCommonNameBesideAltNames", Peer::kSServer, "san", false, "files.example.org",
                "-tls1_3", 0},
        TlsCase{"ServerAltNameMismatch", Peer::kSServer, "san", false, "other.example.org",
                "-tls1_3", -24},
        TlsCase{"ServerExpiredAllowed", Peer::kSServer, "expired", true, "nas.example.lan",
                "-tls1_3", 0},
        TlsCase{"ServerSelfSignedRefusedEvenWithMatchingHost", Peer::kSServer, "selfsigned", false,
                "nas.example.lan", "-tls1_3", -24},
        TlsCase{"ServerAllowedSkipsHostCheck", Peer::kSServer, "plain", true, "wrong.example.com",
                "-tls1_3", 0},
        TlsCase{"ClientVerifiesUsTls13", Peer::kSClient, "plain", true, "", "-tls1_3", 0},
        TlsCase{"ClientVerifiesUsTls12", Peer::kSClient, "plain", false, "", "-tls1_2", 0},
        // No client certificate is asked for: nothing fails verification, but there is no
        // certificate to carry an expected name either.
        TlsCase{"ClientWithoutCertificateWhenAHostIsExpected", Peer::kSClient, "plain", false,
                "client.example.lan", "-tls1_3", -24}),
    [](const ::testing::TestParamInfo<TlsCase>& info) { return std::string(info.param.name); });

// ---- The channel's own rules

TEST_F(Tls, RefusedLegacyCipherListLeavesTheDefaultsExactlyAndNoErrorBehind) {
    auto names = [](SSL_CTX* ctx) {
        std::vector<std::string> out;
        STACK_OF(SSL_CIPHER)* ciphers = SSL_CTX_get_ciphers(ctx);
        for (int i = 0; i < sk_SSL_CIPHER_num(ciphers); ++i) {
            out.push_back(SSL_CIPHER_get_name(sk_SSL_CIPHER_value(ciphers, i)));
        }
        return out;
    };
    SSL_CTX* fresh = SSL_CTX_new(TLS_client_method());
    const std::vector<std::string> defaults = names(fresh);
    SSL_CTX_free(fresh);
    SSL* ssl = nullptr;
    SSL_CTX* ctx = nullptr;
    ASSERT_EQ(Channel::InitSSL(ssl, ctx, false, true), 0);
    EXPECT_TRUE(Logged("can't set cipher suit to SSL3_TXT_RSA_RC4_128_MD5\n"));
    EXPECT_EQ(names(ctx), defaults);
    EXPECT_EQ(ERR_peek_error(), 0u);
    Channel::DeinitSSL(ssl, ctx, true);
    EXPECT_TRUE(ssl == nullptr && ctx == nullptr);
}

TEST_F(Tls, SetupFailuresReportTheFileKeepThePlainChannelAndNeverThePassPhrase) {
    struct Setup {
        bool server;
        std::string cert, key, ca, message;
    };
    const std::string cert = certs_->cert_file("plain"), key = certs_->key_file("plain");
    const std::string ca = certs_->ca_file();
    const Setup setups[] = {
        {true, certs_->path("missing.pem"), key, ca, "Open: init ssl certificate failed"},
        {true, cert, certs_->path("missing.key"), ca, "Open: init ssl private key failed"},
        {true, cert, certs_->path("stray.key"), ca, "Open: init ssl private key failed"},
        // A key under a pass phrase fails at once rather than prompt on a terminal.
        {true, cert, certs_->path("locked.key"), ca, "Open: init ssl private key failed"},
        {false, cert, key, certs_->path("missing-ca.pem"),
         "SSL_CTX_load_verify_locations(" + certs_->path("missing-ca.pem") + ") failed"},
    };
    for (const Setup& s : setups) {
        SCOPED_TRACE(s.message);
        log_.emplace();
        Channel::SetCERTPath(s.cert);
        Channel::SetPriKeyPath(s.key);
        Channel::SetVerifyCAPath(s.ca);
        Listener listener;
        TestChannel channel;
        int peer = -1;
        if (s.server) {
            peer = listener.Connect();
            ASSERT_EQ(channel.Accept(listener), 0);
        } else {
            ASSERT_EQ(channel.Open("127.0.0.1", listener.port()), 0);
            peer = listener.Accept();
        }
        channel.SetAllowUntrust(false);
        EXPECT_EQ(channel.ConvertToSSLChannel(s.server), -2);
        EXPECT_TRUE(Logged(s.message));
        EXPECT_TRUE(Logged("Open: init ssl failed") && Logged("ssl-errors: "));
        EXPECT_FALSE(Logged("not-for-the-log"));
        // Nothing went over the wire: both sides can still talk in the clear.
        ASSERT_EQ(channel.Send("plain"), 0);
        char got[5];
        ASSERT_EQ(recv(peer, got, 5, MSG_WAITALL), 5);
        ASSERT_EQ(send(peer, "reply", 5, 0), 5);
        EXPECT_EQ("reply", channel.Receive(5));
        close(peer);
    }
}

TEST_F(Tls, LargeTransferBothWaysWrapsBothRingsAtEveryOffset) {
    QuietLog();
    const std::string upload = RandomBytes(8 * 1024 * 1024 + 3, 1);
    const std::string download = RandomBytes(6 * 1024 * 1024 + 11, 2);
    // A small ring on one side and the message size on the other, with pieces that never line
    // up with either.
    Listener listener;
    std::string server_got;
    auto server = ServeOnce(listener, [&](TestChannel& channel) {
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0);
        server_got = channel.Receive(upload.size(), 5000);
        ASSERT_EQ(channel.Send(download), 0);
        EXPECT_EQ("ack", channel.Receive(3));
    });
    TestChannel client(4099);
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0);
    ASSERT_EQ(client.Send(upload, 4099), 0);
    EXPECT_TRUE(client.Receive(download.size(), 70001) == download);
    ASSERT_EQ(client.Send("ack"), 0);
    server.get();
    EXPECT_TRUE(server_got == upload);
    EXPECT_FALSE(Logged("ssl-errors"));
}

TEST_F(Tls, BufferedBytesCrossTheConversionBothWays) {
    Listener listener;
    auto server = ServeOnce(listener, [&](TestChannel& channel) {
        ASSERT_EQ(channel.Send("0123456789"), 0);  // in the clear
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0);
        EXPECT_EQ("early", channel.Receive(5));
        ASSERT_EQ(channel.Send("later"), 0);
    });
    TestChannel client;
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    EXPECT_EQ("0123", client.Receive(4));
    ASSERT_EQ(client.BufferedRead(), 6u) << "the ten plain bytes arrive in one segment";
    // Written before the conversion, sent after it, encrypted.
    ASSERT_EQ(client.Write("early", 5), 0);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0);
    EXPECT_EQ(client.BufferedWrite(), 5u);
    ASSERT_EQ(client.FlushWrite(0), 0);
    EXPECT_EQ("456789later", client.Receive(11));
    server.get();
}

TEST_F(Tls, SecondConversionChangesNothingAndCloseEndsTheSessionForAPlainReopen) {
    TestChannel closed;
    EXPECT_EQ(closed.ConvertToSSLChannel(false), -2);
    EXPECT_TRUE(Logged("set fd failed") && closed.IsClosed());
    Listener listener;
    auto server = ServeOnce(listener, [&](TestChannel& channel) {
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0);
        EXPECT_EQ("bye!", channel.Receive(4));
        EXPECT_EQ("<status -2>", channel.Receive(1));  // the close-notify, then end of stream
    });
    TestChannel client;
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0);
    SSL* session = client.Session();
    EXPECT_EQ(client.ConvertToSSLChannel(false), 0);
    EXPECT_TRUE(Logged("ConvertToSSLChannel: Channel is SSL channel, no need to be converted"));
    EXPECT_EQ(client.Session(), session);
    ASSERT_EQ(client.Write("bye!", 4), 0);
    client.Close();  // flushes the four bytes first
    EXPECT_TRUE(client.IsClosed() && !client.IsSSL());
    EXPECT_TRUE(Logged("destroy ssl obj") && Logged("Channel: socket "));
    server.get();

    Listener plain;
    int peer = -1;
    std::thread accept([&] { peer = plain.Accept(); });
    ASSERT_EQ(client.Open("127.0.0.1", plain.port()), 0);
    accept.join();
    ASSERT_EQ(client.Send("clear"), 0);
    char got[5];
    ASSERT_EQ(recv(peer, got, 5, MSG_WAITALL), 5);
    EXPECT_EQ(std::string(got, 5), "clear");
    close(peer);
}

TEST_F(Tls, AbortFlagStopsReadsButNeitherTheHandshakeNorItsTimeout) {
    Listener listener;
    std::promise<void> finished;
    auto server = ServeOnce(listener, [&](TestChannel& channel) {
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0);
        finished.get_future().wait();
    });
    int abort = 1;
    TestChannel client;
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    client.SetFlag(&abort);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0);
    EXPECT_EQ("<status -1>", client.Receive(1));
    finished.set_value();
    server.get();

    Listener silent;  // completes the TCP handshake, never answers the TLS one
    TestChannel waiting;
    waiting.SetTimeout(2);
    ASSERT_EQ(waiting.Open("127.0.0.1", silent.port()), 0);
    waiting.SetFlag(&abort);
    const auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(waiting.ConvertToSSLChannel(false), -2);
    EXPECT_GE(std::chrono::steady_clock::now() - start, 1900ms);
    EXPECT_TRUE(Logged("SSLHandshake: timed out during connect (2 seconds), abort anyway"));
    EXPECT_TRUE(Logged("Open to SSL connect to server failed"));
    EXPECT_FALSE(waiting.IsClosed() || waiting.IsSSL());
}

TEST_F(Tls, PeerSpeakingPlainTextFailsTheHandshake) {
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
    EXPECT_TRUE(Logged("SSLHandshake: SSL fatel error code: 1\n")) << log_->Text();
    EXPECT_TRUE(Logged("ssl-errors: ") && Logged("Open to SSL connect to server failed"));
}

// A raw OpenSSL server completes the handshake, sends one whole record and only the first half
// of the next, pauses, and closes the connection.
TEST_F(Tls, PeerClosingMidRecordDeliversTheWholeRecordsOnly) {
    Listener listener;
    std::promise<void> half_sent, may_close;
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
            SSL_write(ssl, std::string(1000, 'x').data(), 1000);
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
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0) << log_->Text();
    half_sent.get_future().wait();
    // Half a record is no data: the read waits it out as quiet intervals.
    char got[1005];
    unsigned int count = 0;
    EXPECT_EQ(client.Read(got, sizeof(got), count), -9);
    EXPECT_EQ("whole", std::string(got, count));
    EXPECT_TRUE(Logged("SSL want read") && Logged("ReadMore: Channel timeout for 2 seconed"));
    may_close.set_value();
    peer.join();
    client.ClearRead();
    EXPECT_EQ(client.Read(got, 1000, count), -2);
    EXPECT_EQ(count, 0u);
    EXPECT_TRUE(Logged("ssl-errors: "));
}

}  // namespace
