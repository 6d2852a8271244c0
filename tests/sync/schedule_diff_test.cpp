// Differential check of Schedule::NextRunAfter against a second computation written here from
// the rules a user is promised, not from the library's day walk:
// - the days a schedule runs on come from civil-calendar arithmetic (weekday formula, month
//   lengths, leap years; a begin day the month lacks rolls over into the next month);
// - monthly and yearly runs are counted from the current month or year on;
// - a day's first run is the moment the local clock shows the start time, found through
//   localtime_r alone (first occurrence in a repeated hour, the jump itself in a skipped one);
// - the repeats follow in plain seconds; the answer is the first run strictly after `now`.
// Thousands of generated schedules and moments per time zone, biased towards clock changes, month
// ends and the run times themselves (asked at, just before and just after each answer). Where
// the zone never changes its clocks, GetNextScheduledSeconds must agree too, but for a yearly 29
// February (which it counts on from 1 March).
#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include "s2s_sync_obj.h"
#include "sync/sync_test_util.h"

namespace {

using S2S::Schedule;
using s2s_test::CivilDate;
using s2s_test::CivilFromDays;
using s2s_test::DaysFromCivil;
using s2s_test::LocalMoment;
using s2s_test::ScopedTZ;
using s2s_test::WeekdayFromDays;

bool IsLeap(long y) {
    return (y % 4 == 0 && y % 100 != 0) || y % 400 == 0;
}

int DaysInMonth(long y, int m) {
    static const int kDays[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
    return m == 2 && IsLeap(y) ? 29 : kDays[m - 1];
}

// Day number of "day d of month m of year y", letting m run past 12 and d past the month's end.
long RolledDay(long y, long m, long d) {
    y += (m - 1) / 12;
    m = (m - 1) % 12 + 1;
    return DaysFromCivil(y, m, 1) + d - 1;
}

long LocalToday(long now) {
    time_t when = static_cast<time_t>(now);
    struct tm local {};
    localtime_r(&when, &local);
    return DaysFromCivil(local.tm_year + 1900L, local.tm_mon + 1L, local.tm_mday);
}

// The run days from today on, in order, far enough ahead for every mode to have a run.
std::vector<long> RunDays(const Schedule& s, long today) {
    std::vector<long> days;
    const CivilDate now = CivilFromDays(today);
    switch (s.GetMode()) {
        case S2S::SCHD_WEEKLY: {
            const std::string week = s.GetWeekSchedule();
            for (long d = today; d < today + 15; ++d) {
                if (week[WeekdayFromDays(d)] == '1') {
                    days.push_back(d);
                }
            }
            break;
        }
        case S2S::SCHD_MONTHLY:
            for (long i = 0; i < 26; ++i) {
                long d = RolledDay(now.year, now.month + i, s.GetBeginDay());
                if (d >= today) {
                    days.push_back(d);
                }
            }
            break;
        case S2S::SCHD_YEARLY:
            for (long i = 0; i < 6; ++i) {
                long d = RolledDay(now.year + i, s.GetBeginMonth(), s.GetBeginDay());
                if (d >= today) {
                    days.push_back(d);
                }
            }
            break;
        case S2S::SCHD_ONCE: {
            long d = RolledDay(s.GetBeginYear(), s.GetBeginMonth(), s.GetBeginDay());
            if (d >= today) {
                days.push_back(d);
            }
            break;
        }
        default:
            break;
    }
    return days;
}

long ExpectedNextRun(const Schedule& s, long now) {
    const long start = s.GetStartHour() * 3600L + s.GetStartMinute() * 60L;
    for (long day : RunDays(s, LocalToday(now))) {
        const long first = LocalMoment(day, start);
        for (long k = 0; k <= s.GetRepeatTimesInDay(); ++k) {
            const long run = first + k * s.GetPeriodSeconds();
            if (run > now) {
                return run;
            }
        }
    }
    return 0;  // only "once" runs out of days
}

// Moments where the UTC offset changes between two years, to the second.
std::vector<long> ClockChanges(long from, long to) {
    std::vector<long> changes;
    const long step = 6 * 3600;
    long offset = s2s_test::GmtOffsetAt(from);
    for (long t = from + step; t <= to; t += step) {
        long next = s2s_test::GmtOffsetAt(t);
        if (next != offset) {
            long lo = t - step;
            long hi = t;  // offset(lo) == offset, offset(hi) != offset
            while (hi - lo > 1) {
                long mid = lo + (hi - lo) / 2;
                (s2s_test::GmtOffsetAt(mid) == offset ? lo : hi) = mid;
            }
            changes.push_back(hi);
            offset = next;
        }
    }
    return changes;
}

struct Generator {
    explicit Generator(unsigned seed) : rng(seed) {}

    long Uniform(long lo, long hi) { return std::uniform_int_distribution<long>(lo, hi)(rng); }
    bool Chance(int percent) { return Uniform(1, 100) <= percent; }
    template <typename T>
    T Pick(const std::vector<T>& values) {
        return values[static_cast<size_t>(Uniform(0, static_cast<long>(values.size()) - 1))];
    }

    Schedule MakeSchedule() {
        Schedule s;
        s.SetMode(Pick<S2S::SCHD_MODE>({S2S::SCHD_WEEKLY, S2S::SCHD_WEEKLY, S2S::SCHD_MONTHLY,
                                        S2S::SCHD_MONTHLY, S2S::SCHD_YEARLY, S2S::SCHD_ONCE}));
        // The small hours are where the clocks change; 23:xx is where days end.
        int hour = Chance(50) ? Pick<int>({0, 1, 2, 2, 3, 23}) : static_cast<int>(Uniform(0, 23));
        int minute = Chance(50) ? Pick<int>({0, 30, 59}) : static_cast<int>(Uniform(0, 59));
        s.SetStartHour(hour);
        s.SetStartMinute(minute);
        long start = hour * 3600L + minute * 60L;
        if (Chance(50)) {
            long repeat = Chance(50) ? Uniform(1, 4) : Uniform(1, 95);
            long max_period = (86399 - start) / repeat;
            if (max_period >= 60) {
                long period = Chance(50) ? Pick<long>({60, 900, 1800, 3600, 5400}) : 0;
                if (period == 0 || period > max_period) {
                    period = Uniform(60, max_period);
                }
                s.SetPeriod(period);
                s.SetRepeatTimesInDay(repeat);
            }
        }
        std::string week(7, '0');
        while (week == "0000000") {
            for (char& c : week) {
                c = Chance(40) ? '1' : '0';
            }
        }
        s.SetWeekSchedule(week);
        long year = Uniform(2015, 2030);
        int month = static_cast<int>(Uniform(1, 12));
        if (Chance(10)) {  // 29 February, for yearly and once
            year = Pick<long>({2016, 2020, 2024, 2028});
            month = 2;
        }
        int last = DaysInMonth(year, month);
        int day = Chance(60) ? last - static_cast<int>(Uniform(0, 3))
                             : static_cast<int>(Uniform(1, last));
        if (day < 1) {
            day = 1;
        }
        s.SetBeginYear(static_cast<int>(year));
        s.SetBeginMonth(month);
        s.SetBeginDay(day);
        return s;
    }

    long MakeNow(const Schedule& s, const std::vector<long>& changes) {
        const long lo = s2s_test::Utc(2020, 1, 1, 0, 0);
        const long hi = s2s_test::Utc(2030, 12, 31, 0, 0);
        switch (Uniform(0, 3)) {
            case 0:
                if (!changes.empty()) {
                    return Pick(changes) + Uniform(-3 * 86400, 3 * 86400);
                }
                return Uniform(lo, hi);
            case 1: {  // around a month end
                long y = Uniform(2020, 2030);
                int m = static_cast<int>(Uniform(1, 12));
                return s2s_test::Utc(y, m, DaysInMonth(y, m), 0, 0) + Uniform(-86400, 2 * 86400);
            }
            case 2:  // around the begin date (once, yearly)
                return s2s_test::Utc(s.GetBeginYear(), s.GetBeginMonth(), s.GetBeginDay(), 0, 0) +
                       Uniform(-2 * 86400, 2 * 86400);
            default:
                return Uniform(lo, hi);
        }
    }

    std::mt19937 rng;
};

std::string Describe(const Schedule& s, long now) {
    std::ostringstream out;
    out << s << "\nnow: " << now;
    return out.str();
}

class ScheduleDifferential : public ::testing::TestWithParam<const char*> {};

TEST_P(ScheduleDifferential, AgreesWithCalendarArithmetic) {
    ScopedTZ tz(GetParam());
    const std::vector<long> changes =
        ClockChanges(s2s_test::Utc(2020, 1, 1, 0, 0), s2s_test::Utc(2031, 1, 1, 0, 0));
    Generator gen(20240331u + static_cast<unsigned>(std::string(GetParam()).size()));
    int checked = 0;
    int failures = 0;
    for (int i = 0; i < 4000 && failures < 10; ++i) {
        const Schedule s = gen.MakeSchedule();
        ASSERT_TRUE(s.Validate()) << Describe(s, 0);
        long now = gen.MakeNow(s, changes);
        std::vector<long> moments = {now};
        const long first = ExpectedNextRun(s, now);
        if (first > 0) {
            moments.insert(moments.end(), {first - 1, first, first + 1});
        }
        for (long at : moments) {
            const long expected = ExpectedNextRun(s, at);
            const long actual = s.NextRunAfter(at);
            ++checked;
            if (changes.empty() && !(s.GetMode() == S2S::SCHD_YEARLY && s.GetBeginDay() == 29 &&
                                     s.GetBeginMonth() == 2)) {
                EXPECT_EQ(actual, s.GetNextScheduledSeconds(at)) << Describe(s, at);
            }
            if (actual != expected) {
                ++failures;
                ADD_FAILURE() << GetParam() << ": expected " << expected << ", got " << actual
                              << " (off by " << actual - expected << " s)\n"
                              << Describe(s, at);
            }
        }
    }
    EXPECT_GT(checked, 12000);
}

INSTANTIATE_TEST_SUITE_P(TimeZones, ScheduleDifferential,
                         ::testing::Values("UTC", "Europe/Berlin", "America/New_York",
                                           "Australia/Sydney", "Australia/Adelaide",
                                           "Australia/Lord_Howe", "Asia/Kolkata",
                                           "America/Santiago"),
                         [](const ::testing::TestParamInfo<const char*>& info) {
                             std::string name = info.param;
                             for (char& ch : name) {
                                 ch = std::isalnum(static_cast<unsigned char>(ch)) ? ch : '_';
                             }
                             return name;
                         });

}  // namespace
