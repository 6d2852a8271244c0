// Batched writes of the pairing store: the updates that processes have waiting at the same moment
// go into one replacement of the file. Each writer leaves its update as a request file in a
// queue beside the store, then takes the store's semaphore. Whoever holds it applies every
// request waiting (its own included) in one locked read-modify-write, and only once the new file
// is durable removes the requests it applied. So a request that is gone when its writer gets the
// semaphore was written durably by someone else, and the writer answers at once; one still there
// makes its writer the next to write. Invariant: a request file exists until its update is
// durable in the store, or until its writer gives up on it (failure, death).
//
// The queue is trusted only as a private directory of the store's writer (a real directory, ours,
// mode 0700); otherwise each writer writes alone. Only regular files of ours named
// "<pid>-<start>-<sequence>" whose process is still the one that wrote them are applied, the
// holder's own update last; nothing else in the queue is read or removed.
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <utility>
#include <vector>

#include "host/pairing_store.h"
#include "platform/section_file.h"
#include "s2s_platform.h"

namespace S2S {
namespace PairingStore {
namespace {

using s2s_platform::SectionDoc;

std::atomic<unsigned> g_sequence{0};

// Holds the store's semaphore for its lifetime (when Acquire succeeded).
class SemaphoreHold {
  public:
    SemaphoreHold() = default;
    ~SemaphoreHold() {
        if (sem_ != nullptr) {
            const int error = VLIBCErrGet();  // closing must not hide why the write failed
            VLIBCSemClose(sem_);              // releases it when held
            VLIBCErrSet(error);
        }
    }
    SemaphoreHold(const SemaphoreHold&) = delete;
    SemaphoreHold& operator=(const SemaphoreHold&) = delete;
    bool Acquire() {
        sem_ = VLIBCSemOpen(kSemaphoreKey);
        return sem_ != nullptr && VLIBCSemLock(sem_) == 0;
    }

  private:
    VLIBSem* sem_ = nullptr;
};

std::string QueueDir(const std::string& store) {
    const size_t slash = store.rfind('/');
    const std::string dir = slash == std::string::npos ? "." : store.substr(0, slash);
    return dir + "/." + store.substr(slash + 1) + ".queue";
}

// A start time that could not be read (the process table unreadable for a moment, say).
constexpr unsigned long long kStartUnknown = ~0ULL;

// When process `pid` started, in clock ticks since boot (field 22 of /proc/<pid>/stat): with the
// pid it names one process even after the pid is used again. 0 when there is no such process,
// kStartUnknown when that cannot be told.
unsigned long long ProcessStart(pid_t pid) {
    std::FILE* f = std::fopen(("/proc/" + std::to_string(pid) + "/stat").c_str(), "re");
    if (f == nullptr) {
        return errno == ENOENT || errno == ESRCH ? 0 : kStartUnknown;
    }
    char buf[1024];
    const size_t n = std::fread(buf, 1, sizeof buf - 1, f);
    std::fclose(f);
    buf[n] = '\0';
    const char* p = std::strrchr(buf, ')');  // the command name may hold blanks and parentheses
    for (int field = 2; p != nullptr && field < 22; ++field) {
        p = std::strchr(p + 1, ' ');
    }
    return p == nullptr ? kStartUnknown : std::strtoull(p + 1, nullptr, 10);
}

enum class Writer {
    kNoRequest,  // the name is not "<pid>-<start>-<sequence>"
    kAlive,      // its writer still runs
    kEnded,      // its writer has ended: nobody waits for its answer
    kUnknown,    // its writer's start could not be read: left for a later look
};

// The writer of the request named `name`.
Writer WriterOf(const std::string& name) {
    const size_t first = name.find('-');
    const size_t second = first == std::string::npos ? first : name.find('-', first + 1);
    if (first == 0 || second == std::string::npos || second == first + 1 ||
        second + 1 == name.size() || name.find('-', second + 1) != std::string::npos ||
        name.find_first_not_of("0123456789-") != std::string::npos) {
        return Writer::kNoRequest;
    }
    const long pid = std::strtol(name.c_str(), nullptr, 10);
    if (pid <= 0) {
        return Writer::kNoRequest;
    }
    const unsigned long long start = ProcessStart(static_cast<pid_t>(pid));
    if (start == kStartUnknown) {
        return Writer::kUnknown;
    }
    return start != 0 && start == std::strtoull(name.c_str() + first + 1, nullptr, 10)
               ? Writer::kAlive
               : Writer::kEnded;
}

// True when `path` is a private directory of this process's user: a request there can only
// have been written by a writer of the store.
bool PrivateDir(const std::string& path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode) && st.st_uid == geteuid() &&
           (st.st_mode & 077) == 0;
}

// Writes the request whole under a hidden name and renames it into the queue, so that the one
// who writes never reads half of it. No sync: a request that a crash loses had no answer yet.
bool PutRequest(const std::string& queue, const std::string& name, const std::string& text) {
    const std::string hidden = queue + "/." + name;
    int fd = open(hidden.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600);
    if (fd < 0) {
        return false;
    }
    bool ok = true;
    for (size_t done = 0; ok && done < text.size();) {
        const ssize_t n = write(fd, text.data() + done, text.size() - done);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        ok = n > 0;
        done += ok ? static_cast<size_t>(n) : 0;
    }
    ok = close(fd) == 0 && ok && rename(hidden.c_str(), (queue + "/" + name).c_str()) == 0;
    if (!ok) {
        unlink(hidden.c_str());
    }
    return ok;
}

struct Request {
    std::string path;
    SectionDoc doc;
    struct timespec queued {};
};

// The requests waiting in the queue, `own` first, the others in the order they were queued.
// Requests of writers that have ended are removed unapplied: nobody waits for their answer; so
// are their hidden, half-written ones. A name that is not a request, a writer that cannot be
// told alive or ended, or an entry that is not a regular file of ours, is left alone.
std::vector<Request> WaitingRequests(const std::string& queue, const std::string& own) {
    std::vector<Request> requests(1);
    requests[0].path = own;
    DIR* d = opendir(queue.c_str());
    if (d == nullptr) {
        return requests;
    }
    while (const struct dirent* e = readdir(d)) {
        const std::string name = e->d_name;
        const std::string path = queue + "/" + name;
        struct stat st;
        // A hidden request is still being written; one whose writer has ended (killed while
        // writing it) will never be finished and goes.
        const bool hidden = name[0] == '.';
        if (path == own || lstat(path.c_str(), &st) != 0 || !S_ISREG(st.st_mode) ||
            st.st_uid != geteuid()) {
            continue;
        }
        const Writer writer = WriterOf(hidden ? name.substr(1) : name);
        if (writer == Writer::kEnded) {
            unlink(path.c_str());
        } else if (writer == Writer::kAlive && !hidden) {
            requests.push_back(Request{path, SectionDoc(), st.st_mtim});
        }
    }
    closedir(d);
    std::sort(requests.begin() + 1, requests.end(), [](const Request& a, const Request& b) {
        return a.queued.tv_sec != b.queued.tv_sec ? a.queued.tv_sec < b.queued.tv_sec
                                                  : a.queued.tv_nsec < b.queued.tv_nsec;
    });
    return requests;
}

// Sets every request's pairs in `doc`, the others' in their order and the holder's own
// (requests[0]) last, so that its answer matches what the store holds. 1 when that changed the
// document, 0 when not.
int Apply(const std::vector<Request>& requests, SectionDoc& doc) {
    int changed = 0;
    for (size_t i = 1; i <= requests.size(); ++i) {
        const Request& request = requests[i % requests.size()];
        for (const std::string& section : request.doc.SectionNames()) {
            const s2s_platform::Pairs pairs = request.doc.SectionPairs(section);
            for (const auto& pair : pairs) {
                std::string value;
                if (!doc.GetValue(section, pair.first, value) || value != pair.second) {
                    changed = 1;
                }
            }
            if (!doc.SetPairs(section, pairs, true)) {
                doc.AppendSection(section, pairs);
                changed = 1;
            }
        }
    }
    return changed;
}

// One locked read-modify-write of the store with `requests`. 0 or -1 (platform error set).
int Write(const std::string& store, const std::vector<Request>& requests) {
    return s2s_platform::UpdateSectionFile(
               store, true, [&requests](SectionDoc& doc) { return Apply(requests, doc); }) < 0
               ? -1
               : 0;
}

}  // namespace

std::string RequestName(pid_t pid, unsigned sequence) {
    return std::to_string(pid) + "-" + std::to_string(ProcessStart(pid)) + "-" +
           std::to_string(sequence);
}

int ApplyUpdates(const std::vector<SectionUpdate>& updates) {
    const char* path = S2SPath(S2S_PATH_PAIRING_STORE);
    if (path == nullptr) {
        VLIBCErrSet(VLIB_ERR_OUT_OF_MEMORY);
        return -1;
    }
    const std::string store = path;
    Request own;
    std::string text;
    for (const SectionUpdate& update : updates) {
        if (!s2s_platform::ValidSectionName(update.section.c_str())) {
            VLIBCErrSet(VLIB_ERR_BAD_PARAMETER);
            return -1;
        }
        text += "[" + update.section + "]\n";
        for (const auto& pair : update.values) {
            if (!s2s_platform::ValidKey(pair.first.c_str()) ||
                !s2s_platform::ValidValue(pair.second.c_str())) {
                VLIBCErrSet(VLIB_ERR_BAD_PARAMETER);
                return -1;
            }
            text += "\t" + pair.first + "=\"" + pair.second + "\"\n";
        }
    }
    int bad_line = 0;
    if (!own.doc.Parse(text, bad_line)) {
        VLIBCErrSet(VLIB_ERR_BAD_PARAMETER);
        return -1;
    }
    const std::string queue = QueueDir(store);
    // A writer that cannot name itself (its start unreadable) would look ended to the others:
    // it writes alone.
    const unsigned long long start = ProcessStart(getpid());
    const std::string name =
        std::to_string(getpid()) + "-" + std::to_string(start) + "-" + std::to_string(g_sequence++);
    own.path = queue + "/" + name;
    const bool queued = start != 0 && start != kStartUnknown &&
                        (mkdir(queue.c_str(), 0700) == 0 || errno == EEXIST) && PrivateDir(queue) &&
                        PutRequest(queue, name, text);

    SemaphoreHold hold;
    if (!hold.Acquire()) {
        if (queued) {
            unlink(own.path.c_str());
        }
        return -1;
    }
    struct stat st;
    if (queued && lstat(own.path.c_str(), &st) != 0 && errno == ENOENT) {
        VLIBCErrSet(VLIB_ERR_NONE);
        return 0;  // written, durably, with someone else's update
    }
    std::vector<Request> requests =
        queued ? WaitingRequests(queue, own.path) : std::vector<Request>(1);
    requests[0].doc = own.doc;
    size_t taken = 1;
    for (size_t i = 1; i < requests.size(); ++i) {
        // A request that cannot be read stays for its writer, who then writes it alone.
        if (s2s_platform::LoadSectionFile(requests[i].path, requests[i].doc) == 0) {
            std::swap(requests[taken++], requests[i]);  // keeps the queued order
        }
    }
    requests.resize(taken);
    int rc = Write(store, requests);
    if (rc != 0 && requests.size() > 1) {
        // Another's update may be what failed (a store grown too large): this one alone.
        requests.resize(1);
        rc = Write(store, requests);
    }
    const int error = VLIBCErrGet();
    for (size_t i = rc == 0 ? requests.size() : 0; i-- > 0;) {
        unlink(requests[i].path.c_str());
    }
    if (rc != 0 && queued) {
        unlink(own.path.c_str());
    }
    VLIBCErrSet(error);
    return rc;
}

}  // namespace PairingStore
}  // namespace S2S
