// Host services of the sync library: an inter-process file lock, temporary file names, control of
// the sync service's daemon, and the local facts a sync client needs (shares, volumes, client
// identity, host name, usable server addresses). Failures return -1 (or an empty string) and log
// one ERROR line where a caller cannot tell the cause otherwise.
#ifndef S2S_HOST_H
#define S2S_HOST_H

#include <string>
#include <vector>

#include "s2s_export.h"

namespace S2S {

// An exclusive advisory lock (flock) on a lock file. The file is opened (created, mode 0600) by
// the constructor and never deleted. Locks of two objects exclude each other even within one
// process, since each object has its own open file description. One object serves one thread.
class S2S_EXPORT SimpleFileLock {
  public:
    // On an open failure the object is still constructed; every lock call then returns -1.
    explicit SimpleFileLock(const std::string& path);
    // Closing the descriptor drops a held lock.
    ~SimpleFileLock();
    // The descriptor moves with the object; a copy would close it twice.
    SimpleFileLock(SimpleFileLock&& other) noexcept;
    SimpleFileLock& operator=(SimpleFileLock&& other) noexcept;
    SimpleFileLock(const SimpleFileLock&) = delete;
    SimpleFileLock& operator=(const SimpleFileLock&) = delete;

    // Blocks until the lock is held. 0 at once when this object holds it already (no counting).
    int ExLock();
    // 0 at once when not held.
    int UnLock();

  private:
    bool locked;
    int fd;
};

// Hands out locks on one agreed lock file.
class S2S_EXPORT LockFactory {
  public:
    explicit LockFactory(const std::string& path);
    // A new lock with its own descriptor: two locks from one factory exclude each other.
    SimpleFileLock GetLock() const;

  private:
    std::string path;
};

// A fresh empty file "/tmp/S2S/temp.XXXXXX" (under $S2S_ROOT when set) reserving a unique name,
// created with O_EXCL|O_NOFOLLOW; "" when it cannot be made. The server writes command output
// into these files, so the directory is checked before every use: it is created at first use
// (mode 0700, missing parents 0755) and refused when it is not a real directory owned by this
// program's user (root on a server) or when its group or other users have any access. This
// departs on purpose from the older rule (the directory made elsewhere and trusted as found,
// failures silent): a directory another user can write let that user redirect the output onto
// any file. A refusal is logged as one ERROR line saying what is wrong and what to do.
S2S_EXPORT std::string GetTempFile();
// The same without logging; on failure `error` says why in words, for the caller to report.
S2S_EXPORT std::string GetTempFile(std::string& error);
// Creates "/tmp/S2S" (under $S2S_ROOT when set) and checks it as GetTempFile does; the service
// calls it at start, so a directory another user made first is reported at once, not at the
// first remote command. False with `error` saying why and what to do.
S2S_EXPORT bool PrepareTempDir(std::string& error);
// Deletes a file from GetTempFile. An empty path does nothing.
S2S_EXPORT void PutTempFile(const std::string& path);

// Control of the service "s2s_daemon" through the platform's service manager.
S2S_EXPORT int StartDaemon();  // 0 also when it is running already
S2S_EXPORT int StopDaemon();   // pauses it; the service stays installed
// True also when the service manager reports an error (the caller then does not start a second).
S2S_EXPORT bool IsDaemonRunning();

S2S_EXPORT bool IsPathExist(const std::string& path);

// Local facts about one shared folder.
class S2S_EXPORT ShareInfo {
  public:
    ShareInfo() = default;

    std::string GetName() const { return name; }
    std::string GetPath() const { return path; }
    // The directory rsync reads: the encrypted (lower) directory of an encrypted share.
    std::string GetModulePath() const { return modulePath; }
    // The name the server knows the share by: "@" + name + "@" for an encrypted share.
    std::string GetModuleName() const { return moduleName; }
    unsigned int GetEncryptKeyLen() const { return encKeyLen; }
    bool IsEncrypted() const { return (status & 0x2) != 0; }
    bool IsAutoMount() const { return (status & 0x4) != 0; }
    bool IsWinShare() const { return (status & 0x800) != 0; }
    // A Windows share always counts as an ACL share.
    bool IsACL() const { return (status & 0x80) != 0 || IsWinShare(); }

  private:
    friend S2S_EXPORT int GetShareInfo(const std::string& name, ShareInfo& info);

    unsigned int status = 0;
    unsigned int encKeyLen = 0;
    std::string name;
    std::string path;
    std::string modulePath;
    std::string moduleName;
};

// Local facts about the volume that holds a share.
class S2S_EXPORT VolumeInfo {
  public:
    VolumeInfo() = default;

    int GetType() const { return type; }
    std::string GetPath() const { return path; }
    bool IsInternal() const { return type == 1; }
    // The mount path without its leading "/"; throws std::out_of_range on an empty path.
    std::string GetName() const { return path.substr(1); }

  private:
    friend S2S_EXPORT int GetVolumeInfo(const std::string& shareName, VolumeInfo& info);

    int type = 0;
    std::string path;
};

// 0 on success, -1 on failure.
S2S_EXPORT int GetShareInfo(const std::string& name, ShareInfo& info);
S2S_EXPORT int GetVolumeInfo(const std::string& shareName, VolumeInfo& info);
// 0 when it could decide (then `valid` is set): shares on internal volumes, or on the PortBox
// model class the shares in the share bin.
S2S_EXPORT int IsValidShare(const std::string& name, bool& valid);
// The serial number (at most 35 characters outside HA), else the first interface's MAC address
// text ("aa:bb:cc:dd:ee:ff"; not in HA mode); "" on failure.
S2S_EXPORT std::string GetClientID();
// The host name with its first `skip` characters dropped when it is longer than `skip`, else
// whole; "" on failure.
S2S_EXPORT std::string GetHostName(unsigned skip);
// Appends the usable addresses of a server to `ips` (the given IP first, then the name's
// addresses, at most 20). 0, or -1 when there is none.
S2S_EXPORT int GetUsableIP(const std::string& serverName, const std::string& serverIP,
                           std::vector<std::string>& ips);

}  // namespace S2S

#endif  // S2S_HOST_H
