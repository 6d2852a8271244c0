// ServerPair: the two servers of a sync on this machine. A sending and a receiving host, each
// under its own S2S_ROOT in a temporary directory (host facts, one volume, share registry); the
// receiver's real rsync daemon, configured, started and stopped by the s2s-receiver program on
// 127.0.0.1; and, when asked for, a real sshd on a free loopback port for runs over SSH.
//
// The sending side reaches a daemon on the standard rsync port only: a pair that needs it moves
// this process (and what it starts) into a network namespace of its own where that port is free.
#ifndef S2S_TESTS_SUPPORT_SERVER_PAIR_H
#define S2S_TESTS_SUPPORT_SERVER_PAIR_H

#include <memory>
#include <string>
#include <vector>

#include "s2s_sync_obj.h"
#include "support/program.h"
#include "support/test_util.h"

namespace s2s_test {

// Moves this process into a fresh network namespace with only its loopback, up; once per process.
bool EnterPrivateNetwork();

struct ShareAttrs {
    bool encrypted = false;
    bool autoMount = false;
    bool acl = false;
    bool winShare = false;
    unsigned keyLen = 0;
};

// One server: a root directory standing for "/".
class Host {
  public:
    Host(const std::string& tag, const std::string& serial);

    const std::string& Root() const { return root_; }
    std::string Volume() const { return root_ + "/volume1"; }
    std::string SharePath(const std::string& name) const { return Volume() + "/" + name; }
    // The ciphertext folder of an encrypted share, and the sending side's key files of it.
    std::string EncryptedPath(const std::string& name) const {
        return Volume() + "/@" + name + "@";
    }
    std::string KeyFile(const std::string& name) const { return root_ + "/keys/" + name + ".key"; }
    std::string AutoKeyFile(const std::string& name) const {
        return root_ + "/keys/" + name + ".auto.key";
    }
    // The receiving side's key folder (a folder per share below it) and command spool.
    std::string KeyDir() const { return root_ + "/usr/vurn/etc/.encrypt"; }
    std::string Spool() const { return root_ + "/var/spool/s2s"; }
    EnvMap Env() const { return {{"S2S_ROOT", root_}}; }

    // host.conf with this serial number ("" for a machine without one) and the one volume.
    void WriteHostConf(const std::string& serial) const;
    // Registers (or replaces) a share and creates its folder <volume>/<name>; for an encrypted
    // one also its ciphertext folder. The share's folder.
    std::string AddShare(const std::string& name, const ShareAttrs& attrs = ShareAttrs()) const;
    // Runs a program of this build with this host's root.
    ProgramResult Run(const std::string& tool, const std::vector<std::string>& args,
                      const std::string& input = std::string(), const EnvMap& extra = {}) const;

  private:
    TempDir dir_;
    std::string root_;
};

struct PairOptions {
    std::string user = "s2suser";  // the receiver's rsync account (root for SSH)
    std::string password = "pw-9Xq2r";
    bool standardPort = false;  // the daemon on the standard port, in a private network
    bool ssh = false;           // also an sshd (see ServerPair::kGuest)
};

class ServerPair {
  public:
    // Besides root, the sshd's logins with the pair's password (in its own copies of
    // /etc/shadow and /etc/passwd): an ordinary account, and uid 0 under another name. The test
    // process's ssh keeps the sshd's host key in a private home.
    static constexpr const char* kGuest = "s2sguest";
    static constexpr const char* kRootAlias = "s2sroot";

    explicit ServerPair(const PairOptions& options = PairOptions());
    ~ServerPair();
    ServerPair(const ServerPair&) = delete;
    ServerPair& operator=(const ServerPair&) = delete;

    // "" when this machine can hold such a pair (then in its private network), else why not.
    static std::string Unavailable(const PairOptions& options);

    // Configures and (re)starts the receiver's daemon, as an old server that knows neither the
    // version query, multi-source pairing nor share attributes when `oldServer`, and the sshd
    // when asked for. "" on success, else what failed.
    std::string Start(bool oldServer = false);
    void Stop();

    Host& Sender() { return sender_; }
    Host& Receiver() { return receiver_; }
    int Port() const { return port_; }
    int SshPort() const { return sshPort_; }
    std::string SshLog() const;
    // A task's connection facts: 127.0.0.1, the account, the sshd's port when there is one.
    S2S::SyncInfo Info(bool ssh = false) const;

  private:
    std::string StartSshd();

    PairOptions options_;
    Host sender_;
    Host receiver_;
    ScopedEnv remoteRoot_;  // where a daemon started over SSH finds the receiver's configuration
    int port_;
    std::unique_ptr<TempDir> sshDir_;
    int sshPort_ = 0;
    std::unique_ptr<Program> sshd_;
    bool started_ = false;
};

}  // namespace s2s_test

#endif  // S2S_TESTS_SUPPORT_SERVER_PAIR_H
