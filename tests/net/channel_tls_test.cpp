// TLS channels. One table of configurations (certificate kind, trust, expected host, protocol)
// against each kind of peer: the library's own other side (with a large transfer both ways, a
// second conversion and the close), `openssl s_server` and `openssl s_client`. Then what the table
// cannot show: the fixed certificate paths, the remaining host-name rules, setup failures that
// keep the plain channel, bytes buffered across the conversion, the abort flag, and peers that
// misbehave (silent, plain text, closing mid-record). Certificates are made
// at run time; the fixed paths are always redirected through the setters.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>

#include <chrono>
#include <cstring>
#include <future>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "net/net_util.h"
#include "net/tls_host_match.h"
#include "s2s_channel.h"

namespace {

using S2S::Channel;
using s2s_test::Listener;
using s2s_test::TempDir;
using namespace std::chrono_literals;
using KeyPtr = std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)>;
using CertPtr = std::unique_ptr<X509, decltype(&X509_free)>;

KeyPtr NewKey() {
    return KeyPtr(EVP_EC_gen("P-256"), EVP_PKEY_free);
}

// A certificate for `common_name` and the DNS names `dns` (both may hold NULs), valid in the
// seconds [from, until] relative to now, signed by `issuer` (self-signed when null).
CertPtr MakeCert(const std::string& common_name, const std::vector<std::string>& dns, EVP_PKEY* key,
                 X509* issuer = nullptr, EVP_PKEY* issuer_key = nullptr, long from = -3600,
                 long until = 86400, bool ca = false) {
    static long serial = 1;
    CertPtr cert(X509_new(), X509_free);
    X509_set_version(cert.get(), 2);
    ASN1_INTEGER_set(X509_get_serialNumber(cert.get()), serial++);
    X509_gmtime_adj(X509_getm_notBefore(cert.get()), from);
    X509_gmtime_adj(X509_getm_notAfter(cert.get()), until);
    X509_set_pubkey(cert.get(), key);
    X509_NAME_add_entry_by_txt(X509_get_subject_name(cert.get()), "CN", MBSTRING_UTF8,
                               reinterpret_cast<const unsigned char*>(common_name.data()),
                               static_cast<int>(common_name.size()), -1, 0);
    X509* signer = issuer != nullptr ? issuer : cert.get();
    X509_set_issuer_name(cert.get(), X509_get_subject_name(signer));
    for (const auto& [nid, value] :
         {std::pair<int, const char*>{NID_basic_constraints,
                                      ca ? "critical,CA:TRUE" : "critical,CA:FALSE"},
          {NID_key_usage, ca ? "critical,keyCertSign,cRLSign" : "critical,digitalSignature"},
          {NID_subject_key_identifier, "hash"}}) {
        X509V3_CTX ctx;
        X509V3_set_ctx(&ctx, signer, cert.get(), nullptr, nullptr, 0);
        X509_EXTENSION* ext = X509V3_EXT_conf_nid(nullptr, &ctx, nid, value);
        X509_add_ext(cert.get(), ext, -1);
        X509_EXTENSION_free(ext);
    }
    GENERAL_NAMES* names = sk_GENERAL_NAME_new_null();
    for (const std::string& name : dns) {
        ASN1_IA5STRING* value = ASN1_IA5STRING_new();
        ASN1_STRING_set(value, name.data(), static_cast<int>(name.size()));
        GENERAL_NAME* entry = GENERAL_NAME_new();
        GENERAL_NAME_set0_value(entry, GEN_DNS, value);
        sk_GENERAL_NAME_push(names, entry);
    }
    if (!dns.empty()) {
        X509_add1_ext_i2d(cert.get(), NID_subject_alt_name, names, 0, X509V3_ADD_DEFAULT);
    }
    GENERAL_NAMES_free(names);
    X509_sign(cert.get(), issuer_key != nullptr ? issuer_key : key, EVP_sha256());
    return cert;
}

void WritePem(const std::string& path, EVP_PKEY* key, std::vector<X509*> chain,
              const char* pass = nullptr) {
    FILE* file = fdopen(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600), "w");
    for (X509* cert : chain) {
        PEM_write_X509(file, cert);
    }
    if (key != nullptr) {
        PEM_write_PrivateKey(file, key, pass ? EVP_aes_256_cbc() : nullptr,
                             reinterpret_cast<unsigned char*>(const_cast<char*>(pass)),
                             pass ? static_cast<int>(std::strlen(pass)) : 0, nullptr, nullptr);
    }
    std::fclose(file);
}

// A CA ("ca.pem") and, per kind, "<kind>.pem" (leaf then CA) and "<kind>.key"; "locked.key" is
// the plain key under a pass phrase, "stray.key" a key of no certificate here.
struct Certificates {
    Certificates() {
        KeyPtr ca_key = NewKey();
        CertPtr ca =
            MakeCert("s2s test CA", {}, ca_key.get(), nullptr, nullptr, -3600, 86400, true);
        WritePem(dir / "ca.pem", nullptr, {ca.get()});
        const struct {
            std::string kind, name;
            std::vector<std::string> dns;
            long from = -3600, until = 86400;
        } kinds[] = {{"plain", "nas.example.lan", {}},
                     {"wildcard", "*.Example.LAN", {}},
                     {"san", "files.example.org", {"backup.example.org", "NAS2.Example.Org"}},
                     {"expired", "nas.example.lan", {}, -2 * 86400, -86400},
                     {"selfsigned", "nas.example.lan", {}},
                     {"forged",
                      std::string("nas.example.lan\0.evil", 21),
                      {std::string("nas.example.lan\0.evil", 21), "backup.example.org"}}};
        for (const auto& k : kinds) {
            KeyPtr key = NewKey();
            const bool self = k.kind == "selfsigned";
            CertPtr cert = MakeCert(k.name, k.dns, key.get(), self ? nullptr : ca.get(),
                                    self ? nullptr : ca_key.get(), k.from, k.until);
            WritePem(
                dir / (k.kind + ".pem"), nullptr,
                self ? std::vector<X509*>{cert.get()} : std::vector<X509*>{cert.get(), ca.get()});
            WritePem(dir / (k.kind + ".key"), key.get(), {});
            if (k.kind == "plain") {
                WritePem(dir / "locked.key", key.get(), {}, "not-for-the-log");
            }
        }
        WritePem(dir / "stray.key", NewKey().get(), {});
    }
    TempDir dir{"s2s-tls-certs"};
};

// An `openssl` process with its output in files (it never blocks on a full pipe) and its
// standard input on a pipe.
class Openssl {
  public:
    explicit Openssl(std::vector<std::string> args) : args_(std::move(args)) {
        std::vector<char*> argv;
        for (std::string& arg : args_) {
            argv.push_back(arg.data());
        }
        argv.push_back(nullptr);
        const std::string out = dir_ / "out", err = dir_ / "err";
        EXPECT_EQ(0, pipe2(in_, O_CLOEXEC));
        child_.emplace([&] {  // between fork and exec: system calls only
            int o = open(out.c_str(), O_WRONLY | O_CREAT, 0600);
            int e = open(err.c_str(), O_WRONLY | O_CREAT, 0600);
            if (o >= 0 && e >= 0 && dup2(in_[0], 0) == 0 && dup2(o, 1) == 1 && dup2(e, 2) == 2) {
                execvp(argv[0], argv.data());
            }
            return 127;
        });
        close(in_[0]);
    }
    ~Openssl() { s2s_test::CloseFd(in_[1]); }
    void Send(const std::string& bytes) { EXPECT_TRUE(s2s_test::WriteAll(in_[1], bytes)); }
    std::string Out() const { return s2s_test::ReadFile(dir_ / "out"); }
    std::string Err() const { return s2s_test::ReadFile(dir_ / "err"); }
    // Waits until a whole line holding `text` shows on standard output (or error).
    bool WaitFor(const std::string& text, bool on_err = false) const {
        return s2s_test::WaitFor(
            [&] {
                const std::string all = on_err ? Err() : Out();
                const size_t at = all.find(text);
                return at != std::string::npos && all.find('\n', at) != std::string::npos;
            },
            20s);
    }
    int Wait() { return child_->Wait(20s); }  // -2 when it still ran after 20 seconds

  private:
    TempDir dir_{"s2s-openssl"};
    std::vector<std::string> args_;
    int in_[2] = {-1, -1};
    std::optional<s2s_test::Child> child_;
};

// Reaches the session and the rings behind a channel.
class TestChannel : public Channel {
  public:
    explicit TestChannel(unsigned int capacity = 81920) : Channel(capacity) { SetTimeout(20); }
    SSL* Session() const { return is_ssl_ ? static_cast<SSL*>(handle_) : nullptr; }
    unsigned int Buffered() const { return r_size_ * 1000 + w_size_; }
    // The library accepting one connection from `listener`.
    int Accept(Listener& listener) {
        int fd = listener.Accept();
        int status = fd < 0 ? -100 : Open(fd, true);
        if (status != 0) {
            s2s_test::CloseFd(fd);
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
    static void SetUpTestSuite() { certs_ = std::make_unique<Certificates>(); }
    static void TearDownTestSuite() { certs_.reset(); }
    void SetUp() override {
        UseServerCert("plain");
        Channel::SetVerifyCAPath(Path("ca.pem"));
    }
    static void UseServerCert(const std::string& kind) {
        Channel::SetCERTPath(Path(kind + ".pem"));
        Channel::SetPriKeyPath(Path(kind + ".key"));
    }
    static std::string Path(const std::string& name) { return certs_->dir / name; }
    bool Logged(const std::string& text) const { return log_->Contains(text); }

    static std::unique_ptr<Certificates> certs_;
    std::optional<s2s_test::LogCapture> log_{std::in_place};
};

std::unique_ptr<Certificates> Tls::certs_;

// In a plain run of the program this runs first, before any setter.
TEST(TlsPaths, DefaultsAreTheFixedFiles) {
    EXPECT_EQ(Channel::GetCertPath() + " " + Channel::GetKeyPath() + " " + Channel::GetCAPath(),
              "/tmp/.cloud_certs /tmp/.cloud_server.key /certs.pem");
}

// The name rules beyond what the handshake rows below show (exact and case-folded names, a
// wildcard's domain and one label below it, alternative names, forged names with a NUL).
TEST(TlsHostName, NamesMatchOnlyByTheWildcardAndCaseRules) {
    const std::tuple<const char*, const char*, bool> names[] = {
        {"nas.example.lan", "nas.example.lan.", false},
        {"nas.example.lan", "nas.example", false},
        {"", "nas.example.lan", false},
        {"\xC3\x84.lan", "\xC3\xA4.lan", false},
        {"*.example.lan", "nasexample.lan", false},
        {"*.example.lan", "example.lan.evil", false},
        {"*.example.lan", "lan", false},
        {"*", "lan", false},
        {"*.", "x.", false},
        {"*x.example.lan", "a.example.lan", false},
    };
    for (const auto& [pattern, host, match] : names) {
        EXPECT_EQ(match, S2S::tls::HostNameMatches(pattern, host)) << pattern << " " << host;
    }
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
    const bool tls12 = c.option == std::string("-tls1_2");
    if (c.peer == Peer::kSServer) {  // the library is the client
        Openssl server({"openssl", "s_server", "-accept", "127.0.0.1:0", "-cert",
                        Path(std::string(c.cert) + ".pem"), "-key",
                        Path(std::string(c.cert) + ".key"), "-naccept", "1", "-rev", c.option});
        ASSERT_TRUE(server.WaitFor("ACCEPT 127.0.0.1:")) << server.Err();
        const int port = std::stoi(server.Out().substr(server.Out().find("ACCEPT ") + 17));
        ASSERT_EQ(channel.Open("127.0.0.1", port), 0);
        EXPECT_EQ(channel.ConvertToSSLChannel(false), c.expected) << log_->Text();
        // The cipher list of old is refused by current OpenSSL: a warning, then the defaults.
        EXPECT_TRUE(Logged("can't set cipher suit to SSL3_TXT_RSA_RC4_128_MD5"));
        if (c.expected == 0) {
            EXPECT_EQ(tls12 ? TLS1_2_VERSION : TLS1_3_VERSION, SSL_version(channel.Session()));
            ASSERT_EQ(channel.Send("hello over tls\n"), 0);
            EXPECT_EQ("slt revo olleh\n", channel.Receive(15));
            // No RC4 offered, and the TLS 1.2 defaults are still there beside the 1.3 suites.
            ASSERT_TRUE(server.WaitFor("Client cipher list:", true));
            std::string offered = server.Err().substr(server.Err().find("Client cipher list:"));
            offered = offered.substr(0, offered.find('\n'));
            EXPECT_TRUE(offered.find("RC4") == std::string::npos &&
                        offered.find(":ECDHE-") != std::string::npos)
                << offered;
        }
        channel.Close();
        EXPECT_EQ(0, server.Wait());
    } else if (c.peer == Peer::kSClient) {  // the library is the server
        Listener listener;
        Openssl client({"openssl", "s_client", "-connect",
                        "127.0.0.1:" + std::to_string(listener.port()), "-CAfile", Path("ca.pem"),
                        "-verify_return_error", "-verify_hostname", "nas.example.lan", "-brief",
                        c.option});
        ASSERT_EQ(channel.Accept(listener), 0);
        EXPECT_EQ(channel.ConvertToSSLChannel(true), c.expected) << log_->Text() << client.Err();
        if (c.expected == 0) {
            EXPECT_TRUE(Logged("cert path = " + Path(std::string(c.cert) + ".pem")));
            ASSERT_TRUE(client.WaitFor("Verification: OK", true)) << client.Err();
            EXPECT_TRUE(client.Err().find(std::string("Protocol version: TLSv1.") +
                                          (tls12 ? "2" : "3")) != std::string::npos);
            client.Send("ping\n");
            EXPECT_EQ("ping\n", channel.Receive(5));
            ASSERT_EQ(channel.Send("pong\n"), 0);
            EXPECT_TRUE(client.WaitFor("pong"));
        }
        channel.Close();
        EXPECT_NE(-2, client.Wait());
    } else {  // the library on both ends: a large transfer wrapping both rings at every offset
        static const std::string upload = RandomBytes(8 * 1024 * 1024 + 3, 1);
        static const std::string download = RandomBytes(6 * 1024 * 1024 + 11, 2);
        log_.emplace(S2S::Logger::Warning);  // per-read debug lines would rotate the file away
        Listener listener;
        std::string server_got;
        auto server = ServeOnce(listener, [&](TestChannel& s) {
            if (s.ConvertToSSLChannel(true) == 0 &&
                (server_got = s.Receive(upload.size(), 5000)) == upload) {
                ASSERT_EQ(s.Send(download), 0);
                EXPECT_EQ("bye!", s.Receive(4));
                EXPECT_EQ("<status -2>", s.Receive(1));  // the close-notify, then end of stream
            }
        });
        TestChannel client(4099);  // a small ring here, the pieces never line up with either
        client.SetAllowUntrust(c.allow_untrusted);
        client.SetSSLHostname(c.host);
        ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
        EXPECT_EQ(client.ConvertToSSLChannel(false), c.expected) << log_->Text();
        if (c.expected == 0) {
            ASSERT_EQ(client.Send(upload, 4099), 0);
            EXPECT_TRUE(client.Receive(download.size(), 70001) == download);
            EXPECT_FALSE(Logged("ssl-errors"));
            // A second conversion changes nothing; closing flushes and ends the session.
            SSL* session = client.Session();
            EXPECT_EQ(client.ConvertToSSLChannel(false), 0);
            EXPECT_TRUE(
                Logged("ConvertToSSLChannel: Channel is SSL channel, no need to be converted"));
            EXPECT_EQ(client.Session(), session);
            ASSERT_EQ(client.Write("bye!", 4), 0);
            client.Close();
            EXPECT_TRUE(client.IsClosed() && client.Session() == nullptr);
        }
        client.Close();
        server.get();
        EXPECT_TRUE(c.expected != 0 || server_got == upload);
    }
    if (c.expected != 0) {  // a refused peer leaves a plain channel for the caller to close
        EXPECT_TRUE(Logged("ConvertToSSLChannel: Verify Fail!"));
    }
}

const Peer kOwn = Peer::kOwnSide, kServer = Peer::kSServer, kClient = Peer::kSClient;
const TlsCase kCases[] = {
    {"OwnTrustedHostMatch", kOwn, "plain", false, "nas.example.lan", "", 0},
    {"OwnHostMismatch", kOwn, "plain", false, "other.example.lan", "", -24},
    {"OwnSelfSignedRefused", kOwn, "selfsigned", false, "", "", -24},
    {"OwnSelfSignedAllowed", kOwn, "selfsigned", true, "", "", 0},
    {"OwnAltNameSecondEntry", kOwn, "san", false, "nas2.example.org", "", 0},
    {"OwnExpiredRefused", kOwn, "expired", false, "", "", -24},
    {"OwnNamesForgedWithANulRefused", kOwn, "forged", false, "nas.example.lan", "", -24},
    {"ServerTrustedNoHost", kServer, "plain", false, "", "-tls1_3", 0},
    {"ServerHostIgnoringCase", kServer, "plain", false, "NAS.example.LAN", "-tls1_3", 0},
    {"ServerTls12Only", kServer, "plain", false, "nas.example.lan", "-tls1_2", 0},
    {"ServerWildcardDomainItself", kServer, "wildcard", false, "example.lan", "-tls1_3", 0},
    {"ServerWildcardOneLabelBelow", kServer, "wildcard", false, "NAS.example.lan", "-tls1_3", 0},
    {"ServerWildcardTwoLabelsBelow", kServer, "wildcard", false, "a.nas.example.lan", "-tls1_3",
     -24},
    {"ServerCommonNameBesideAltNames", kServer, "san", false, "files.example.org", "-tls1_3", 0},
    {"ServerAltNameMismatch", kServer, "san", false, "other.example.org", "-tls1_3", -24},
    {"ServerExpiredAllowed", kServer, "expired", true, "nas.example.lan", "-tls1_3", 0},
    {"ServerSelfSignedRefusedWithHost", kServer, "selfsigned", false, "nas.example.lan", "-tls1_3",
     -24},
    {"ServerAllowedSkipsHostCheck", kServer, "plain", true, "wrong.example.com", "-tls1_3", 0},
    {"ClientVerifiesUsTls13", kClient, "plain", true, "", "-tls1_3", 0},
    {"ClientVerifiesUsTls12", kClient, "plain", false, "", "-tls1_2", 0},
    // No client certificate is asked for: nothing fails verification, but there is no
    // certificate to carry an expected name either.
    {"ClientWithoutCertificateWhenAHostIsExpected", kClient, "plain", false, "client.example.lan",
     "-tls1_3", -24},
};
INSTANTIATE_TEST_SUITE_P(, TlsMatrix, ::testing::ValuesIn(kCases),
                         [](const auto& info) { return std::string(info.param.name); });

// ---- What the table cannot show

TEST_F(Tls, SetupFailuresReportTheFileKeepThePlainChannelAndNeverThePassPhrase) {
    const struct {
        bool server;
        std::string cert, key, ca, message;
    } setups[] = {
        {true, "missing.pem", "plain.key", "ca.pem", "Open: init ssl certificate failed"},
        {true, "plain.pem", "missing.key", "ca.pem", "Open: init ssl private key failed"},
        {true, "plain.pem", "stray.key", "ca.pem", "Open: init ssl private key failed"},
        // A key under a pass phrase fails at once rather than prompt on a terminal.
        {true, "plain.pem", "locked.key", "ca.pem", "Open: init ssl private key failed"},
        {false, "plain.pem", "plain.key", "missing-ca.pem",
         "SSL_CTX_load_verify_locations(" + Path("missing-ca.pem") + ") failed"},
    };
    for (const auto& s : setups) {
        SCOPED_TRACE(s.message);
        log_.emplace();
        Channel::SetCERTPath(Path(s.cert));
        Channel::SetPriKeyPath(Path(s.key));
        Channel::SetVerifyCAPath(Path(s.ca));
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
        EXPECT_TRUE(Logged(s.message) && Logged("Open: init ssl failed") && Logged("ssl-errors: "));
        EXPECT_FALSE(Logged("not-for-the-log"));
        // Nothing went over the wire: both sides can still talk in the clear.
        ASSERT_EQ(channel.Send("plain"), 0);
        EXPECT_EQ("plain", s2s_test::ReadExactly(peer, 5));
        ASSERT_TRUE(s2s_test::WriteAll(peer, "reply"));
        EXPECT_EQ("reply", channel.Receive(5));
        s2s_test::CloseFd(peer);
    }
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
    ASSERT_EQ(client.Buffered(), 6000u) << "the ten plain bytes arrive in one segment";
    // Written before the conversion, sent after it, encrypted.
    ASSERT_EQ(client.Write("early", 5), 0);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0);
    EXPECT_EQ(client.Buffered(), 6005u);
    ASSERT_EQ(client.FlushWrite(0), 0);
    EXPECT_EQ("456789later", client.Receive(11));
    server.get();
}

// The abort flag stops TLS reads; neither it nor anything but the timeout ends a handshake with a
// peer that never answers; a peer answering in plain text fails it at once. A closed channel
// cannot be converted.
TEST_F(Tls, AbortFlagStopsReadsAndOnlyTheTimeoutOrABadAnswerEndsAHandshake) {
    TestChannel closed;
    EXPECT_EQ(closed.ConvertToSSLChannel(false), -2);
    EXPECT_TRUE(Logged("set fd failed") && closed.IsClosed());
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
    waiting.SetTimeout(1);
    ASSERT_EQ(waiting.Open("127.0.0.1", silent.port()), 0);
    waiting.SetFlag(&abort);
    const auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(waiting.ConvertToSSLChannel(false), -2);
    EXPECT_GE(std::chrono::steady_clock::now() - start, 900ms);
    EXPECT_TRUE(Logged("SSLHandshake: timed out during connect (1 seconds), abort anyway"));
    EXPECT_TRUE(Logged("Open to SSL connect to server failed"));
    EXPECT_FALSE(waiting.IsClosed() || waiting.Session() != nullptr);

    Listener answering;
    auto plain = std::async(std::launch::async, [&] {  // answers the client hello in plain text
        int fd = answering.Accept();
        char hello[64];
        EXPECT_GT(recv(fd, hello, sizeof(hello), 0), 0);
        s2s_test::WriteAll(fd, "HTTP/1.0 400 Bad Request\r\n\r\n");
        s2s_test::CloseFd(fd);
    });
    TestChannel answered;
    ASSERT_EQ(answered.Open("127.0.0.1", answering.port()), 0);
    EXPECT_EQ(answered.ConvertToSSLChannel(false), -2);
    plain.get();
    EXPECT_TRUE(Logged("SSLHandshake: SSL fatel error code: 1\n")) << log_->Text();
}

// A raw OpenSSL server completes the handshake, sends one whole record and only the first half
// of the next, pauses, and closes the connection.
TEST_F(Tls, PeerClosingMidRecordDeliversTheWholeRecordsOnly) {
    Listener listener;
    std::promise<void> half_sent, may_close;
    auto peer = std::async(std::launch::async, [&] {
        SSL_CTX* ctx = SSL_CTX_new(TLS_server_method());
        SSL_CTX_use_certificate_chain_file(ctx, Path("plain.pem").c_str());
        SSL_CTX_use_PrivateKey_file(ctx, Path("plain.key").c_str(), SSL_FILETYPE_PEM);
        SSL_CTX_set_num_tickets(ctx, 0);
        int fd = listener.Accept();
        SSL* ssl = SSL_new(ctx);
        SSL_set_fd(ssl, fd);
        if (SSL_accept(ssl) == 1) {
            // From here on records are built in memory and put on the wire by hand.
            BIO* records = BIO_new(BIO_s_mem());
            SSL_set0_wbio(ssl, records);
            std::string bytes[2];
            for (int i = 0; i < 2; ++i) {
                SSL_write(ssl, i == 0 ? "whole" : std::string(1000, 'x').c_str(), i ? 1000 : 5);
                bytes[i].resize(static_cast<size_t>(BIO_pending(records)));
                BIO_read(records, bytes[i].data(), static_cast<int>(bytes[i].size()));
            }
            s2s_test::WriteAll(fd, bytes[0] + bytes[1].substr(0, bytes[1].size() / 2));
        }
        half_sent.set_value();
        may_close.get_future().wait();
        s2s_test::CloseFd(fd);
        SSL_free(ssl);
        SSL_CTX_free(ctx);
    });
    TestChannel client;
    client.SetTimeout(1);
    ASSERT_EQ(client.Open("127.0.0.1", listener.port()), 0);
    ASSERT_EQ(client.ConvertToSSLChannel(false), 0) << log_->Text();
    half_sent.get_future().wait();
    // Half a record is no data: the read waits it out as quiet intervals.
    char got[1005];
    unsigned int count = 0;
    EXPECT_EQ(client.Read(got, sizeof(got), count), -9);
    EXPECT_EQ("whole", std::string(got, count));
    EXPECT_TRUE(Logged("SSL want read") && Logged("ReadMore: Channel timeout for 1 seconed"));
    may_close.set_value();
    peer.get();
    client.ClearRead();
    EXPECT_EQ(client.Read(got, 1000, count), -2);
    EXPECT_EQ(count, 0u);
    EXPECT_TRUE(Logged("ssl-errors: "));
}

}  // namespace
