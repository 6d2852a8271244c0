// Logger: where log lines go, their filtering, time stamps and size-based rotation. Every write,
// the size accounting and a rotation happen under log_mutex, so lines of different threads never
// interleave; Initialize and Destroy change the settings without it and must not run while
// another thread logs.
#include "s2s_logger.h"

#include <pthread.h>
#include <sys/stat.h>
#include <syslog.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <ctime>

namespace S2S {

int Logger::log_level = 3;
int Logger::log_size = -1;
int Logger::rotate_cnt = 50;
int Logger::log_type = Logger::Syslog;
std::string Logger::log_path;

// The stream and its lock belong to this file alone: the header does not show them. Their storage
// carries the exported names S2S::Logger::log_fp and S2S::Logger::log_mutex, which programs built
// against the library's first header refer to, so such programs still link and share this state.
S2S_EXPORT FILE* log_fp __asm__("_ZN3S2S6Logger6log_fpE") = nullptr;
S2S_EXPORT pthread_mutex_t log_mutex __asm__("_ZN3S2S6Logger9log_mutexE") =
    PTHREAD_MUTEX_INITIALIZER;

namespace {

constexpr int kRotateSize = 1048576;

std::string RotatedName(int index) {
    char name[1024];
    std::snprintf(name, sizeof(name), "%s_%d", Logger::log_path.c_str(), index);
    return name;
}

}  // namespace

int Logger::Initialize(Type type, int level, const std::string& path, int count) {
    log_type = type;
    log_level = level;
    switch (type) {
        case Syslog:
            log_fp = nullptr;
            log_path.clear();
            log_size = -1;
            return 0;
        case Stdout:
            log_fp = stdout;
            log_path.clear();
            log_size = -1;
            return 0;
        case Stderr:
            log_fp = stderr;
            log_path.clear();
            log_size = -1;
            return 0;
        default:
            break;
    }
    if (path.empty()) {
        return -1;
    }
    FILE* fp = std::fopen(path.c_str(), "ae");
    if (fp == nullptr) {
        return -1;
    }
    // Any other kind is the file kind. The size already in the file is not counted, on purpose.
    log_type = File;
    log_fp = fp;
    log_size = 0;
    log_path = path;
    rotate_cnt = count;
    return 0;
}

void Logger::LogMsg(Level level, const char* format, ...) {
    // log_level only changes in Initialize/Destroy, which never run while another thread logs, so
    // a filtered message can be dropped before the lock: the answer under the lock is the same.
    if (level > log_level) {
        return;
    }
    pthread_mutex_lock(&log_mutex);
    // The stream is looked at under the lock only: a rotation in another thread closes it and
    // opens the next one while holding the lock, and a line that saw it closed in between was lost.
    if (level > log_level || (log_type != Syslog && log_fp == nullptr)) {
        pthread_mutex_unlock(&log_mutex);
        return;
    }
    int written = -1;
    va_list args;
    va_start(args, format);
    if (log_type == Syslog) {
        // The level filters; it does not set the priority: every line goes out as an error, and
        // the process's own openlog settings (identity, facility) apply.
        vsyslog(LOG_ERR, format, args);
    } else if (log_type < Syslog || log_type > File) {
        std::vfprintf(stderr, format, args);
    } else if (log_fp != nullptr) {
        char stamp[512];
        time_t now = std::time(nullptr);
        struct tm local;
        localtime_r(&now, &local);
        std::strftime(stamp, sizeof(stamp), "%b %d %H:%M:%S ", &local);
        int head = std::fprintf(log_fp, "%s", stamp);
        int body = std::vfprintf(log_fp, format, args);
        std::fflush(log_fp);
        written = head + body;
        if (head < 0 || body < 0) {
            written = -1;
        }
    }
    va_end(args);
    if (log_type == File && log_size >= 0 && written >= 0) {
        log_size += written;
        if (log_size > kRotateSize) {
            Rotate();
            log_size = 0;
        }
    }
    pthread_mutex_unlock(&log_mutex);
}

int Logger::Rotate() {
    for (int i = rotate_cnt - 2; i >= 0; --i) {
        std::rename(RotatedName(i).c_str(), RotatedName(i + 1).c_str());
    }
    // After the renames, on purpose: the file just moved to the last index goes, so at most
    // rotate_cnt - 1 rotated files survive.
    std::remove(RotatedName(rotate_cnt - 1).c_str());
    if (log_fp != nullptr) {
        std::fclose(log_fp);
        log_fp = nullptr;
    }
    if (std::rename(log_path.c_str(), RotatedName(0).c_str()) != 0) {
        return -1;
    }
    FILE* fp = std::fopen(log_path.c_str(), "ae");
    if (fp == nullptr) {
        return -1;
    }
    log_fp = fp;
    return 0;
}

int Logger::Reopen(mode_t mode) {
    if (log_type != File || log_path.empty()) {
        errno = EINVAL;
        return -1;
    }
    FILE* fresh = std::fopen(log_path.c_str(), "ae");
    if (fresh == nullptr) {
        return -1;
    }
    if (fchmod(fileno(fresh), mode) != 0) {
        const int saved = errno;
        std::fclose(fresh);
        errno = saved;
        return -1;
    }
    pthread_mutex_lock(&log_mutex);
    FILE* old = log_fp;
    log_fp = fresh;
    log_size = 0;
    pthread_mutex_unlock(&log_mutex);
    if (old != nullptr && old != stdout && old != stderr) {
        std::fclose(old);
    }
    return 0;
}

void Logger::Destroy() {
    if (log_type != File) {
        return;
    }
    if (log_fp != nullptr) {
        std::fclose(log_fp);
    }
    // The kind says standard error while the stream is standard output; both are written alike.
    log_fp = stdout;
    log_level = 3;
    log_type = Stderr;
    log_size = -1;
    log_path.clear();
    rotate_cnt = 50;
}

}  // namespace S2S
