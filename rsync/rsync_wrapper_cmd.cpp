// Custom commands: the command lines travel as rsync's early input to the server's command module,
// prefixed by a reply token of the client's choosing; the same run pulls the reply directory of
// that token, which holds the handler's result code and output file. The answer is taken the
// moment the reply is complete; rsync's own end (a wait of 20 ms or more at the end of every
// pull) then goes on in the background.
#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <memory>
#include <sstream>
#include <utility>

#include "core/protocol.h"
#include "rsync/rsync_wrapper_impl.h"
#include "s2s_logger.h"

namespace VURN {
namespace Backup {

namespace {

namespace reply = S2S::protocol;

// A directory private to this run (mode 0700), removed with its content on every path.
class PrivateDir {
  public:
    PrivateDir() {
        const char* base = std::getenv("TMPDIR");
        std::string pattern =
            std::string(base != nullptr && *base == '/' ? base : "/tmp") + "/s2s-cmd.XXXXXX";
        std::vector<char> buffer(pattern.begin(), pattern.end());
        buffer.push_back('\0');
        if (mkdtemp(buffer.data()) != nullptr) {
            path_ = buffer.data();
        }
    }
    ~PrivateDir() {
        if (!path_.empty()) {
            reply::RemoveTree(path_);
        }
    }
    PrivateDir(const PrivateDir&) = delete;
    PrivateDir& operator=(const PrivateDir&) = delete;
    const std::string& path() const { return path_; }
    // The directory is no longer this object's to remove.
    std::string Release() { return std::exchange(path_, std::string()); }

  private:
    std::string path_;
};

bool RandomToken(std::string* token) {
    unsigned char bytes[reply::kTokenBytes];
    size_t got = 0;
    while (got < sizeof bytes) {
        ssize_t n = getrandom(bytes + got, sizeof bytes - got, 0);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        got += static_cast<size_t>(n);
    }
    static const char kHex[] = "0123456789abcdef";
    token->clear();
    for (unsigned char b : bytes) {
        token->push_back(kHex[b >> 4]);
        token->push_back(kHex[b & 0xf]);
    }
    return true;
}

bool WriteWhole(const std::string& path, const std::string& content, int flags, mode_t mode) {
    int fd = open(path.c_str(), flags | O_WRONLY | O_CLOEXEC, mode);
    if (fd < 0) {
        return false;
    }
    size_t done = 0;
    bool ok = true;
    while (done < content.size()) {
        ssize_t n = write(fd, content.data() + done, content.size() - done);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            ok = false;
            break;
        }
        done += static_cast<size_t>(n);
    }
    return close(fd) == 0 && ok;
}

// The output file's content comes from the server. The caller names its own reserved temporary
// file (or a name that does not exist yet); it is never written through a symbolic link, into
// something that is not a plain file, into a file of another user or into one with other names
// (hard links). "" on success, else why not.
std::string WriteOutputFile(const std::string& path, const std::string& content) {
    int fd = open(path.c_str(), O_WRONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
    if (fd < 0 && errno == ENOENT) {
        fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
    }
    if (fd < 0) {
        return errno == ELOOP ? "it is a symbolic link" : strerror(errno);
    }
    struct stat st;
    std::string why;
    if (fstat(fd, &st) != 0) {
        why = strerror(errno);
    } else if (!S_ISREG(st.st_mode) || st.st_nlink != 1 || st.st_uid != geteuid()) {
        why = "it is not a plain file of this user with a single name";
    } else if (ftruncate(fd, 0) != 0) {
        why = strerror(errno);
    }
    for (size_t done = 0; why.empty() && done < content.size();) {
        ssize_t n = write(fd, content.data() + done, content.size() - done);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            why = n < 0 ? strerror(errno) : "short write";
            break;
        }
        done += static_cast<size_t>(n);
    }
    if (close(fd) != 0 && why.empty()) {
        why = strerror(errno);
    }
    return why;
}

// True once the reply's result file is in place with a result code in it. rsync renames each
// file into place only when it has it whole, and takes the output file before the result file
// (the order of their names), so the whole reply is there by then.
bool ReplyComplete(const std::string& replyDir) {
    std::ifstream in(replyDir + "/" + reply::kResultFile);
    std::stringstream text;
    text << in.rdbuf();
    int result = 0;
    return in.is_open() && reply::ParseResult(text.str(), &result);
}

// An inotify descriptor watching a directory for files renamed into it (-1 when it cannot).
class RenameWatch {
  public:
    explicit RenameWatch(const std::string& dir) : fd_(inotify_init1(IN_NONBLOCK | IN_CLOEXEC)) {
        if (fd_ >= 0 && inotify_add_watch(fd_, dir.c_str(), IN_MOVED_TO) < 0) {
            close(fd_);
            fd_ = -1;
        }
    }
    ~RenameWatch() {
        if (fd_ >= 0) {
            close(fd_);
        }
    }
    RenameWatch(const RenameWatch&) = delete;
    RenameWatch& operator=(const RenameWatch&) = delete;
    int fd() const { return fd_; }
    // Takes the events that made the descriptor readable.
    void Drain() const {
        char events[4096];
        while (fd_ >= 0 && read(fd_, events, sizeof events) > 0) {
        }
    }

  private:
    int fd_;
};

// The local path the caller named in outfile="...", or "".
std::string OutfileOf(const std::list<std::string>& lines) {
    static const std::string kPrefix = std::string(reply::kKeyOutfile) + "=\"";
    for (const auto& line : lines) {
        if (line.size() > kPrefix.size() && line.compare(0, kPrefix.size(), kPrefix) == 0 &&
            line.back() == '"') {
            return line.substr(kPrefix.size(), line.size() - kPrefix.size() - 1);
        }
    }
    return std::string();
}

}  // namespace

int RsyncWrapper::Impl::ExecuteCommand(const boost::function<bool()>& cancel) {
    std::string why = CheckConnection();
    std::string input;
    std::string token;
    if (why.empty() && !RandomToken(&token)) {
        why = "no random numbers for the reply token";
    }
    if (why.empty()) {
        input = reply::TokenLine(token);
        for (const auto& line : cmdLines) {
            if (line.find('\n') != std::string::npos || line.find('\0') != std::string::npos) {
                why = "a command line holds a line break or NUL";
                break;
            }
            input += line + "\n";
        }
        if (input.size() > reply::kMaxCommandFile) {
            why = "the command file is larger than the server accepts";
        }
    }
    if (!why.empty()) {
        return RefuseRun(why);
    }

    PrivateDir dir;
    const std::string inputFile = dir.path() + "/command";
    const std::string replyDir = dir.path() + "/reply";
    if (dir.path().empty() || !WriteWhole(inputFile, input, O_CREAT | O_EXCL, 0600)) {
        lastError = std::string("cannot write the command file: ") + strerror(errno);
        Logger::LogMsg(Logger::Error, "[ERROR] rsync_wrapper.cpp(%d): %s\n", __LINE__,
                       lastError.c_str());
        return kResultLocalFile;
    }

    ChildCommand job;
    // The reply is pulled whatever the list-only setting says: a command run copies nothing else.
    job.argv = {"--recursive", "--max-size=" + std::to_string(reply::kMaxOutput),
                "--early-input=" + inputFile};
    ConnectionOptions(&job.argv);
    job.argv.push_back("--");
    job.argv.push_back(Url(commandModule + "/" + token + "/"));
    job.argv.push_back(replyDir + "/");
    Environment(&job);
    // The reply directory is made here so that it can be watched from the start.
    bool complete = false;
    std::unique_ptr<RenameWatch> watch;
    if (mkdir(replyDir.c_str(), 0700) == 0) {
        watch = std::make_unique<RenameWatch>(replyDir);
    }
    if (watch && watch->fd() >= 0) {
        job.ready_fd = watch->fd();
        job.ready = [&watch, &replyDir, &complete]() {
            watch->Drain();
            complete = ReplyComplete(replyDir);
            return complete;
        };
        // The reply was taken before rsync ended; a failed end afterwards is still told.
        job.after_exit = [path = dir.path()](int status) {
            reply::RemoveTree(path);
            if (status == -1) {
                Logger::LogMsg(Logger::Warning,
                               "[WARNING] rsync_wrapper.cpp(%d): the command's rsync did not end "
                               "after its reply and was stopped\n",
                               __LINE__);
            } else if (WIFEXITED(status) && WEXITSTATUS(status) != 0) {
                Logger::LogMsg(Logger::Warning,
                               "[WARNING] rsync_wrapper.cpp(%d): the command's rsync ended with "
                               "code %d after its reply\n",
                               __LINE__, WEXITSTATUS(status));
            } else if (WIFSIGNALED(status)) {
                Logger::LogMsg(Logger::Warning,
                               "[WARNING] rsync_wrapper.cpp(%d): the command's rsync ended by "
                               "signal %d after its reply\n",
                               __LINE__, WTERMSIG(status));
            }
        };
    }
    int rc = Run(job, cancel, true);
    if (complete) {
        dir.Release();  // removed once rsync has ended
    }
    if (rc != 0) {
        return rc;
    }

    int result = 0;
    std::ifstream resultFile(replyDir + "/" + reply::kResultFile);
    std::stringstream text;
    text << resultFile.rdbuf();
    if (!resultFile.is_open() || !reply::ParseResult(text.str(), &result)) {
        lastError = "the server's reply holds no result code";
        Logger::LogMsg(Logger::Error, "[ERROR] rsync_wrapper.cpp(%d): %s\n", __LINE__,
                       lastError.c_str());
        return kResultBadReply;
    }

    std::string outfile = OutfileOf(cmdLines);
    const std::string output = replyDir + "/" + reply::kOutputFile;
    struct stat st;
    if (!outfile.empty() && lstat(output.c_str(), &st) == 0) {
        if (!S_ISREG(st.st_mode) || st.st_size > static_cast<off_t>(reply::kMaxOutput)) {
            lastError = "the server's output file is not a plain file of at most 1 MiB";
            return kResultBadReply;
        }
        std::ifstream in(output, std::ios::binary);
        std::stringstream content;
        content << in.rdbuf();
        // The caller's file (from its temporary-file service) keeps its owner and mode.
        const std::string why = in.is_open() ? WriteOutputFile(outfile, content.str())
                                             : "the reply's output cannot be read";
        if (!why.empty()) {
            lastError = "cannot write the output file " + outfile + ": " + why;
            Logger::LogMsg(Logger::Error, "[ERROR] rsync_wrapper.cpp(%d): %s\n", __LINE__,
                           lastError.c_str());
            return kResultLocalFile;
        }
    }
    return result;
}

}  // namespace Backup
}  // namespace VURN
