// Helpers for the sync model tests: a time zone for the duration of a test, captured log output,
// and civil-calendar arithmetic that does not go through mktime.
#ifndef S2S_TESTS_SYNC_SYNC_TEST_UTIL_H
#define S2S_TESTS_SYNC_SYNC_TEST_UTIL_H

#include <gtest/gtest.h>
#include <unistd.h>

#include <ctime>
#include <regex>
#include <string>

#include "s2s_logger.h"
#include "support/test_util.h"

namespace s2s_test {

// Sets TZ for the object's lifetime and makes the C library re-read it both ways.
class ScopedTZ {
  public:
    // Without the zone's file the C library silently falls back to UTC: say so instead.
    explicit ScopedTZ(const char* zone) : env_("TZ", zone) {
        if (std::string(zone) != "UTC" &&
            access(("/usr/share/zoneinfo/" + std::string(zone)).c_str(), R_OK) != 0) {
            ADD_FAILURE() << "time zone " << zone << " is not installed (Debian package tzdata)";
        }
        tzset();
    }
    ScopedTZ(const ScopedTZ&) = delete;
    ScopedTZ& operator=(const ScopedTZ&) = delete;

  private:
    struct Retzset {
        ~Retzset() { tzset(); }
    };
    Retzset retzset_;  // declared first, so destroyed last: after env_ has put TZ back
    ScopedEnv env_;
};

// Sends the library's log to a private file at level DEBUG; Text() is what was logged, without
// the time stamps. Puts the logger back to its initial state (syslog, level 3) afterwards.
class StampFreeLogCapture {
  public:
    StampFreeLogCapture() : dir_("s2s-sync-log") {
        path_ = dir_ / "log";
        S2S::Logger::Initialize(S2S::Logger::File, S2S::Logger::Debug, path_, 5);
    }
    ~StampFreeLogCapture() {
        S2S::Logger::Destroy();
        S2S::Logger::Initialize(S2S::Logger::Syslog, S2S::Logger::Error, "", 0);
    }
    StampFreeLogCapture(const StampFreeLogCapture&) = delete;
    StampFreeLogCapture& operator=(const StampFreeLogCapture&) = delete;

    std::string Text() const {
        static const std::regex stamp("[A-Z][a-z]{2} [ 0-9][0-9] [0-9]{2}:[0-9]{2}:[0-9]{2} ");
        return std::regex_replace(ReadFile(path_), stamp, "");
    }

  private:
    TempDir dir_;
    std::string path_;
};

// Days since 1970-01-01 of a proleptic Gregorian date (month 1 to 12).
inline long DaysFromCivil(long y, long m, long d) {
    y -= m <= 2 ? 1 : 0;
    const long era = (y >= 0 ? y : y - 399) / 400;
    const long yoe = y - era * 400;
    const long doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
    const long doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    return era * 146097 + doe - 719468;
}

struct CivilDate {
    long year;
    int month;  // 1 to 12
    int day;
};

inline CivilDate CivilFromDays(long z) {
    z += 719468;
    const long era = (z >= 0 ? z : z - 146096) / 146097;
    const long doe = z - era * 146097;
    const long yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
    const long doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
    const long mp = (5 * doy + 2) / 153;
    const int d = static_cast<int>(doy - (153 * mp + 2) / 5 + 1);
    const int m = static_cast<int>(mp < 10 ? mp + 3 : mp - 9);
    return CivilDate{yoe + era * 400 + (m <= 2 ? 1 : 0), m, d};
}

// 0 = Sunday; 1970-01-01 was a Thursday.
inline int WeekdayFromDays(long days) {
    long w = (days + 4) % 7;
    return static_cast<int>(w < 0 ? w + 7 : w);
}

// Seconds since the epoch of a UTC wall-clock time.
inline long Utc(long y, long m, long d, long hour, long minute, long second = 0) {
    return DaysFromCivil(y, m, d) * 86400 + hour * 3600 + minute * 60 + second;
}

// UTC offset in seconds of the local time zone at moment t.
inline long GmtOffsetAt(long t) {
    time_t when = static_cast<time_t>(t);
    struct tm local {};
    localtime_r(&when, &local);
    return local.tm_gmtoff;
}

inline bool LocalWallClockIs(long t, long days, long second_of_day) {
    time_t when = static_cast<time_t>(t);
    struct tm local {};
    if (localtime_r(&when, &local) == nullptr) {
        return false;
    }
    return DaysFromCivil(local.tm_year + 1900L, local.tm_mon + 1L, local.tm_mday) == days &&
           local.tm_hour * 3600L + local.tm_min * 60L + local.tm_sec == second_of_day;
}

// The moment the local clock shows `second_of_day` on day `days` (days since 1970-01-01), found
// by trying the offsets in force a day before and a day after: the first of two moments inside a
// repeated hour; inside a skipped hour, the first moment after it (the jump), found by bisection
// between the two readings. Works from localtime_r alone, independently of mktime.
inline long LocalMoment(long days, long second_of_day) {
    const long wall = days * 86400 + second_of_day;
    const long before = wall - GmtOffsetAt(wall - 86400);
    const long after = wall - GmtOffsetAt(wall + 86400);
    const bool before_ok = LocalWallClockIs(before, days, second_of_day);
    const bool after_ok = LocalWallClockIs(after, days, second_of_day);
    if (before_ok && after_ok) {
        return before < after ? before : after;
    }
    if (before_ok || after_ok) {
        return before_ok ? before : after;
    }
    long lo = before < after ? before : after;  // its clock shows less than `wall`
    long hi = before < after ? after : before;
    while (hi - lo > 1) {
        const long mid = lo + (hi - lo) / 2;
        (mid + GmtOffsetAt(mid) >= wall ? hi : lo) = mid;
    }
    return hi;
}

inline long Local(long y, long m, long d, long hour, long minute, long second = 0) {
    return LocalMoment(DaysFromCivil(y, m, d), hour * 3600 + minute * 60 + second);
}

}  // namespace s2s_test

#endif  // S2S_TESTS_SYNC_SYNC_TEST_UTIL_H
