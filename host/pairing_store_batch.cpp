// Batched writes of the pairing store: the updates that processes have waiting at the same moment
// go into one replacement of the file. Each writer leaves its update as a request file in a
// queue beside the store, then takes the store's semaphore. Whoever holds it applies every
// request waiting (its own included) in one locked read-modify-write, and only once the new file
// is durable removes the requests it applied. So a request that is gone when its writer gets the
// semaphore was written durably by someone else, and the writer answers at once; one still there
// makes its writer the next to write. Invariant: a request file exists until its update is
// durable in the store, or until its writer gives up on it (failure, death).
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
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
            VLIBCSemClose(sem_);  // releases it when held
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

// The writer's pid from a request's name "<pid>-<sequence>"; 0 when it is not one.
pid_t WriterOf(const std::string& name) {
    const size_t dash = name.find('-');
    if (dash == 0 || dash == std::string::npos ||
        name.find_first_not_of("0123456789-") != std::string::npos) {
        return 0;
    }
    return static_cast<pid_t>(std::strtol(name.substr(0, dash).c_str(), nullptr, 10));
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
};

// The requests waiting in the queue, `own` first. Requests of writers that have ended are
// removed unapplied: nobody waits for their answer.
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
        if (name[0] == '.' || path == own) {
            continue;
        }
        const pid_t writer = WriterOf(name);
        if (writer <= 0 || (kill(writer, 0) != 0 && errno == ESRCH)) {
            unlink(path.c_str());
            continue;
        }
        requests.push_back(Request{path, SectionDoc()});
    }
    closedir(d);
    return requests;
}

// Sets every request's pairs in `doc`. 1 when that changed the document, 0 when not.
int Apply(const std::vector<Request>& requests, SectionDoc& doc) {
    int changed = 0;
    for (const Request& request : requests) {
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
    const std::string name = std::to_string(getpid()) + "-" + std::to_string(g_sequence++);
    own.path = queue + "/" + name;
    const bool queued =
        (mkdir(queue.c_str(), 0700) == 0 || errno == EEXIST) && PutRequest(queue, name, text);

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
            std::swap(requests[taken++], requests[i]);
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
