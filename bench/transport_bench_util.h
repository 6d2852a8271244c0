// Shared pieces of the transport benchmarks: the two message shapes measured, a receiving thread
// that is always joined, and blocking whole-buffer socket I/O for the raw anchors.
#ifndef S2S_BENCH_TRANSPORT_BENCH_UTIL_H
#define S2S_BENCH_TRANSPORT_BENCH_UTIL_H

#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <initializer_list>
#include <string>
#include <utility>

#include "s2s_pobject.h"

namespace s2s_bench {

// Sets each key of `fields` in the map `map`.
inline void SetFields(S2S::PObject& map,
                      std::initializer_list<std::pair<const char*, S2S::PObject>> fields) {
    for (const auto& field : fields) {
        map[field.first] = field.second;
    }
}

// A sync task as the daemon and its front ends exchange it: about 25 keys, a share list and the
// nested connection settings.
inline S2S::PObject TaskMap() {
    S2S::PObject task;
    SetFields(task, {{"task_id", 17ULL},
                     {"task_name", "Nightly copy to the backup server"},
                     {"status", 2ULL},
                     {"last_result", 0ULL},
                     {"last_run", 1700000000ULL},
                     {"next_run", 1700086400ULL},
                     {"enabled", 1ULL},
                     {"created_by", "admin"},
                     {"description", "copies the media shares every night at two"}});
    S2S::PObject::Array shares;
    for (const char* name : {"music", "photos", "video", "documents", "homes"}) {
        shares.push_back(S2S::PObject(name));
    }
    task["shares"] = shares;
    SetFields(task["sync_info"], {{"server", "192.168.10.20"},
                                  {"port", 873ULL},
                                  {"user", "backup"},
                                  {"compress", 1ULL},
                                  {"encrypt", 1ULL},
                                  {"bandwidth", 0ULL},
                                  {"timeout", 600ULL},
                                  {"keep_deleted", 0ULL},
                                  {"sparse", 1ULL}});
    SetFields(task["schedule"],
              {{"mode", 1ULL}, {"hour", 2ULL}, {"minute", 0ULL}, {"weekdays", 127ULL}});
    return task;
}

// A large message: an array of 10,000 small maps (a file list).
inline S2S::PObject LargeList() {
    S2S::PObject list;
    S2S::PObject::Array& items = list.asArray();
    items.reserve(10000);
    for (unsigned long long i = 0; i < 10000; ++i) {
        S2S::PObject item;
        item["id"] = i;
        item["name"] = "file_" + std::to_string(i) + ".jpg";
        item["size"] = i * 4096 + 17;
        items.push_back(std::move(item));
    }
    return list;
}

inline void IgnoreSigpipe() {
    signal(SIGPIPE, SIG_IGN);
}

inline void Die(const char* what) {
    std::perror(what);
    std::abort();
}

inline void WriteAll(int fd, const char* data, size_t size) {
    while (size > 0) {
        ssize_t n = write(fd, data, size);
        if (n <= 0) {
            Die("write");
        }
        data += n;
        size -= static_cast<size_t>(n);
    }
}

// False when the peer closed before the first byte.
inline bool ReadAll(int fd, char* data, size_t size) {
    size_t done = 0;
    while (done < size) {
        ssize_t n = read(fd, data + done, size - done);
        if (n <= 0) {
            if (n == 0 && done == 0) {
                return false;
            }
            Die("read");
        }
        done += static_cast<size_t>(n);
    }
    return true;
}

}  // namespace s2s_bench

#endif  // S2S_BENCH_TRANSPORT_BENCH_UTIL_H
