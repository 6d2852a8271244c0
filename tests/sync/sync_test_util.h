// Helpers for the sync model tests: a time zone for the duration of a test, the captured log as a
// user reads it, and calendar arithmetic for checking schedules: civil dates through the C
// library's UTC functions, local moments through localtime_r alone, never through mktime.
#ifndef S2S_TESTS_SYNC_SYNC_TEST_UTIL_H
#define S2S_TESTS_SYNC_SYNC_TEST_UTIL_H

#include <gtest/gtest.h>
#include <unistd.h>
#include <ctime>
#include <regex>
#include <string>

#include "support/test_util.h"

namespace s2s_test {

// Sets TZ for the object's lifetime and makes the C library re-read it both ways. Without the
// zone's file the C library silently falls back to UTC: say so instead.
class ScopedTZ : NoCopy {
  public:
    explicit ScopedTZ(const char* zone) : env_(std::in_place, "TZ", zone) {
        if (std::string(zone) != "UTC" &&
            access(("/usr/share/zoneinfo/" + std::string(zone)).c_str(), R_OK) != 0) {
            ADD_FAILURE() << "time zone " << zone << " is not installed (Debian package tzdata)";
        }
        tzset();
    }
    ~ScopedTZ() { env_.reset(), tzset(); }

  private:
    std::optional<ScopedEnv> env_;
};

// What `log` holds without the time stamps and source line numbers: the texts a user reads.
inline std::string Logged(const LogCapture& log) {
    static const std::regex noise("[A-Z][a-z]{2} [ 0-9][0-9] [0-9:]{8} |\\([0-9]+\\)");
    return std::regex_replace(log.Text(), noise, "");
}

// Days since 1970-01-01 of day `d` of month `m` of year `y`; months past 12 and days past the
// month's end roll over into the following ones.
inline long DaysFromCivil(long y, long m, long d) {
    struct tm t {};
    t.tm_year = static_cast<int>(y - 1900);
    t.tm_mon = static_cast<int>(m - 1);
    t.tm_mday = static_cast<int>(d);
    return static_cast<long>(timegm(&t) / 86400);
}

// The UTC calendar fields of a day number, and the local ones of a moment.
inline struct tm CivilFromDays(long days, bool local = false) {
    const time_t when = static_cast<time_t>(local ? days : days * 86400);
    struct tm t {};
    local ? localtime_r(&when, &t) : gmtime_r(&when, &t);
    return t;
}

// UTC offset in seconds of the local time zone at moment t.
inline long GmtOffsetAt(long t) {
    return CivilFromDays(t, true).tm_gmtoff;
}

// Seconds since the epoch of a UTC wall-clock time.
inline long Utc(long y, long m, long d, long hour, long minute, long second = 0) {
    return DaysFromCivil(y, m, d) * 86400 + hour * 3600 + minute * 60 + second;
}

// The moment the local clock shows `second_of_day` on day `days`, trying the offsets in force a
// day before and a day after: the first of two moments in a repeated hour; in a skipped hour the
// jump itself, found by bisection between the two readings.
inline long LocalMoment(long days, long second_of_day) {
    const long wall = days * 86400 + second_of_day;
    auto shows_wall = [&](long t) { return t + GmtOffsetAt(t) == wall; };
    const long before = wall - GmtOffsetAt(wall - 86400);
    const long after = wall - GmtOffsetAt(wall + 86400);
    if (shows_wall(before) || shows_wall(after)) {
        return shows_wall(before) && shows_wall(after) ? std::min(before, after)
               : shows_wall(before)                    ? before
                                                       : after;
    }
    long lo = std::min(before, after);  // its clock shows less than `wall`
    long hi = std::max(before, after);
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
