// Schedule: coupled setters, week normalisation and mode texts, validation with its NOTE lines,
// and the next run: a differential check against calendar arithmetic written here, over
// thousands of generated schedules and moments in each listed time zone, plus about twenty named
// edge cases (modes, repeats, month ends, 29 February, moments the calendar cannot express, clock
// changes), each also checked for the compatible computation, which keeps the daylight-saving
// flag of the day it started from.
#include <gtest/gtest.h>

#include <climits>
#include <cstdio>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include "s2s_sync_obj.h"
#include "sync/sync_test_util.h"

namespace {

using S2S::Schedule;
using s2s_test::CivilFromDays;
using s2s_test::DaysFromCivil;
using s2s_test::LogCapture;
using s2s_test::Logged;
using s2s_test::ScopedTZ;
using s2s_test::Utc;

Schedule Dated(S2S::SCHD_MODE mode, int year, int month, int day, int hour, int minute,
               long period = 0, long repeat = 0) {
    Schedule s;
    s.SetMode(mode);
    s.SetBeginYear(year);
    s.SetBeginMonth(month);
    s.SetBeginDay(day);
    s.SetStartHour(hour);
    s.SetStartMinute(minute);
    if (period != 0) {  // setting either to 0 clears the other
        s.SetPeriod(period);
    }
    if (repeat != 0) {
        s.SetRepeatTimesInDay(repeat);
    }
    return s;
}

Schedule Weekly(const char* week, int hour, int minute, long period = 0, long repeat = 0) {
    Schedule s = Dated(S2S::SCHD_WEEKLY, 2014, 1, 1, hour, minute, period, repeat);
    s.SetWeekSchedule(week);
    return s;
}

TEST(ScheduleFields, PeriodAndRepeatClearEachOtherOnlyOnZero) {
    Schedule s = Dated(S2S::SCHD_WEEKLY, 2014, 1, 1, 0, 0, 1800, 3);
    s.SetPeriod(0);
    EXPECT_EQ(0, s.GetRepeatTimesInDay());
    s = Dated(S2S::SCHD_WEEKLY, 2014, 1, 1, 0, 0, 1800, 3);
    s.SetRepeatTimesInDay(0);
    EXPECT_EQ(0, s.GetPeriodSeconds());
    s.SetRepeatTimesInDay(4);  // a non-zero value leaves the other alone, even at 0
    EXPECT_EQ(0, s.GetPeriodSeconds());
    s.SetPeriod(25, 59);
    EXPECT_EQ(25 * 3600 + 59 * 60, s.GetPeriodSeconds());
    s.SetPeriod(90);  // seconds below a minute are not reported
    EXPECT_EQ(0, s.GetPeriodHourPart());
    EXPECT_EQ(1, s.GetPeriodMinutePart());
}

TEST(ScheduleFields, WeekScheduleIsNormalisedAndModesReadAndPrintByOneTable) {
    const std::pair<const char*, const char*> weeks[] = {
        {"0101010", "0101010"}, {"000000", "1111111"},    {"0000000", "1111111"},
        {"", "1111111"},        {"1x0000000", "1100000"}, {"0000001111", "0000001"}};
    for (const auto& [given, stored] : weeks) {
        Schedule s = Weekly("0101010", 0, 0);
        s.SetWeekSchedule(given);
        EXPECT_EQ(stored, s.GetWeekSchedule()) << "'" << given << "'";
    }
    const std::pair<int, const char*> modes[] = {{0, "manual"},  {1, "realtime"}, {2, "weekly"},
                                                 {3, "monthly"}, {4, "yearly"},   {5, "once"},
                                                 {6, "weekly"},  {-1, "weekly"}};
    for (const auto& [mode, text] : modes) {
        Schedule s;
        s.SetMode(static_cast<S2S::SCHD_MODE>(mode));
        EXPECT_EQ(text, s.GetModeStr()) << mode;
        s.SetModeByStr(text);
        EXPECT_EQ(mode < 0 || mode > 5 ? 2 : mode, s.GetMode()) << text;
    }
    for (const char* unknown : {"", "Weekly", "weekly ", "daily"}) {
        Schedule s;
        s.SetMode(S2S::SCHD_ONCE);
        s.SetModeByStr(unknown);
        EXPECT_EQ(S2S::SCHD_MANUAL, s.GetMode()) << "'" << unknown << "'";
    }
}

TEST(ScheduleFields, ScheduleBeginIsTheUnnormalisedBeginAtTheStartTime) {
    const struct tm b = Dated(S2S::SCHD_ONCE, 2024, 4, 31, 7, 45).GetScheduleBegin();
    EXPECT_EQ(std::vector<int>({124, 3, 31, 7, 45, 0, 0, 0, 0}),
              std::vector<int>({b.tm_year, b.tm_mon, b.tm_mday, b.tm_hour, b.tm_min, b.tm_sec,
                                b.tm_isdst, b.tm_wday, b.tm_yday}));
}

TEST(GetDaysToNextSync, CountsFromTodayAndWrapsTheWeek) {
    EXPECT_EQ(6, S2S::GetDaysToNextSync(0, "0000001"));            // Sunday to Saturday
    EXPECT_EQ(0, S2S::GetDaysToNextSync(3, "0001000"));            // today counts
    EXPECT_EQ(3, S2S::GetDaysToNextSync(5, "0100000"));            // Friday to Monday
    EXPECT_EQ(-1, S2S::GetDaysToNextSync(2, "xxxxxxx"));           // only "1" counts here
    EXPECT_EQ(1, S2S::GetDaysToNextSync(4294967295u, "0000100"));  // mod 7 = 3, not mod 2^32
}

// Validation: the rules in order, the first broken one logs its NOTE line and wins.
TEST(ScheduleValidate, EachRuleLogsItsLineAndTheFirstBrokenRuleWins) {
    ScopedTZ tz("UTC");
    const S2S::SCHD_MODE manual = S2S::SCHD_MANUAL;
    const std::string p = "[NOTE] s2s_sync_obj.cpp: ";
    const std::pair<Schedule, std::string> cases[] = {
        {Dated(manual, 2014, 1, 1, 24, 0), p + "Invalid begin hour\n"},
        {Dated(manual, 2014, 1, 1, -1, 60), p + "Invalid begin hour\n"},
        {Dated(manual, 2014, 1, 1, 0, -5), p + "Invalid begin minute\n"},
        {Dated(manual, 2014, 1, 1, 0, 0, 86400), p + "Invalid period or repeat\n"},
        {Dated(manual, 2014, 1, 1, 0, 0, -60, 1), p + "Invalid period or repeat\n"},
        {Dated(manual, 2014, 1, 1, 0, 0, 60, 96), p + "Invalid period\n"},
        {Dated(manual, 2014, 1, 1, 0, 0, 60, -1), p + "Invalid period\n"},
        {Dated(manual, 2014, 1, 1, 23, 0, 1800, 2),
         p + "Invalid repeat in day [82800 + 1800 * 2]\n"},
        {Dated(manual, 1960, 1, 1, 0, 0), p + "Invalid begin\n" + p + "60 0 1 12 0 0\n"},
        {Dated(manual, 2014, 2, 29, 0, 0), p + "Invalid begin date\n"},
        {Dated(manual, 2014, 4, 31, 0, 0), p + "Invalid begin date\n"},
        {Dated(manual, 2014, 13, 1, 0, 0), p + "Invalid begin date\n"},
        {Dated(manual, 2014, 1, 0, 0, 0), p + "Invalid begin date\n"},
        {Dated(static_cast<S2S::SCHD_MODE>(6), 2014, 1, 1, 0, 0),
         p + "Invalid schedule mode [6]\n"},
        {Dated(static_cast<S2S::SCHD_MODE>(-1), 2014, 1, 1, 0, 0),
         p + "Invalid schedule mode [-1]\n"},
        // Every mode is checked the same way, even those that ignore the begin date.
        {Dated(S2S::SCHD_REALTIME, 2024, 2, 30, 0, 0), p + "Invalid begin date\n"},
    };
    EXPECT_TRUE(
        Dated(S2S::SCHD_WEEKLY, 2014, 1, 1, 23, 59, 59, 1).Validate());  // ends at 86399 exactly
    EXPECT_TRUE(Dated(S2S::SCHD_WEEKLY, 2014, 1, 1, 0, 0, 900, 95).Validate());
    for (const auto& [schedule, line] : cases) {
        LogCapture log;
        EXPECT_FALSE(schedule.Validate()) << line;
        EXPECT_EQ(line, Logged(log));
    }
}

// Next run. Times are local "YYYY-MM-DD HH:MM[:SS]" or "@SECONDS"; "@0" is no next run, "@-1" an
// error. `compatible` is given only where the compatible computation differs.
struct EdgeCase {
    const char* what;
    const char* zone;
    Schedule schedule;
    std::string now;
    std::string next;
    std::string compatible = "";
    std::string log = "";
};

long At(const std::string& text) {
    if (text[0] == '@') {
        return std::stol(text.substr(1));
    }
    int y = 0, mo = 0, d = 0, h = 0, mi = 0, sec = 0;
    EXPECT_GE(std::sscanf(text.c_str(), "%d-%d-%d %d:%d:%d", &y, &mo, &d, &h, &mi, &sec), 5);
    return s2s_test::Local(y, mo, d, h, mi, sec);
}

TEST(ScheduleNextRun, NamedEdgeCases) {
    const std::string e = "[ERROR] s2s_sync_obj.cpp: ";
    const std::string noon = "@" + std::to_string(Utc(2024, 5, 1, 12, 0));
    const Schedule leap_yearly = Dated(S2S::SCHD_YEARLY, 2024, 2, 29, 6, 0);
    const Schedule daily9 = Weekly("1111111", 9, 0);
    const char* berlin = "Europe/Berlin";
    const std::vector<EdgeCase> cases = {
        {"manual never runs by itself", "UTC", Dated(S2S::SCHD_MANUAL, 2014, 1, 1, 8, 0), noon,
         "@0"},
        {"realtime runs a second later", "UTC", Dated(S2S::SCHD_REALTIME, 2014, 1, 1, 8, 0), noon,
         "@" + std::to_string(Utc(2024, 5, 1, 12, 0, 1))},
        {"a negative now is an error", "UTC", Dated(S2S::SCHD_REALTIME, 2014, 1, 1, 8, 0), "@-1",
         "@-1"},
        {"an unknown mode cannot be aligned", "UTC",
         Dated(static_cast<S2S::SCHD_MODE>(6), 2014, 1, 1, 8, 0), noon, "@-1", "",
         e + "Unknown schedule mode [6]\n" + e + "Fail to align to scheduled day\n"},
        // localtime cannot express the time, so the zeroed fields (day 0 of 1900) are used.
        {"now beyond the calendar", "UTC", daily9, "@" + std::to_string(LONG_MAX), "@-1", "",
         e + "Fail to get reference seconds, year:[-1], mon:[11], mday:[31], hour:[0], "
             "min:[0], sec:[0], dst:[0]\n"},
        {"once before the epoch", "UTC", Dated(S2S::SCHD_ONCE, 1960, 1, 1, 8, 0),
         "2024-01-01 12:00", "@-1", "",
         e + "Fail to get scheduled seconds, year:[60], mon:[0], mday:[1], hour:[12], "
             "min:[0], sec:[0], dst:[0]\n"},
        // At the epoch it is still 31 December 1969 in New York; that day's 08:00 cannot be
        // expressed, so it is skipped.
        {"a day before the epoch is skipped", "America/New_York", Weekly("1111111", 8, 0), "@0",
         "1970-01-01 08:00", "",
         e + "Fail to get scheduled seconds, year:[69], mon:[11], mday:[31], hour:[8], "
             "min:[0], sec:[0], dst:[0]\n"},
        {"Saturday only, from Sunday", berlin, Weekly("0000001", 9, 0), "2024-01-14 10:00",
         "2024-01-20 09:00"},
        {"repeats (08:00, 09:00, 10:00): at the last", berlin, Weekly("1111111", 8, 0, 3600, 2),
         "2024-01-15 10:00", "2024-01-16 08:00"},
        {"the 31st in a common February", berlin, Dated(S2S::SCHD_MONTHLY, 2014, 1, 31, 9, 0),
         "2023-02-10 00:00", "2023-03-03 09:00"},
        {"29 February in a common year", berlin, leap_yearly, "2025-01-10 00:00",
         "2025-03-01 06:00"},
        // After a common year's run on 1 March the compatible computation counts on from 1 March.
        {"29 February, the year before a leap year", "UTC", leap_yearly, "2027-03-02 00:00",
         "2028-02-29 06:00", "2028-03-01 06:00"},
        {"once: at the run", berlin, Dated(S2S::SCHD_ONCE, 2024, 2, 29, 9, 0), "2024-02-29 09:00",
         "@0"},
        {"once with repeats: at the last", "UTC", Dated(S2S::SCHD_ONCE, 2024, 6, 10, 8, 0, 3600, 2),
         "2024-06-10 10:00", "@0"},
        // Berlin 2024: 31 March 02:00 CET -> 03:00 CEST, 27 October 03:00 CEST -> 02:00 CET. The
        // compatible computation keeps the flag of the evening before (08:00 and 10:00 instead).
        {"09:00 after going back, from the evening before", berlin, daily9, "2024-10-26 23:00",
         "2024-10-27 09:00", "2024-10-27 08:00"},
        {"09:00 after going forward, from the evening before", berlin, daily9, "2024-03-30 23:00",
         "2024-03-31 09:00", "2024-03-31 10:00"},
        // Aligned at 23:30 with the winter flag, Monday night is read as Tuesday 00:30.
        {"Mondays, from Saturday 23:30 before going forward", berlin, Weekly("0100000", 9, 0),
         "2024-03-30 23:30", "2024-04-01 09:00", "2024-04-02 09:00"},
        {"02:30 repeated, asked between its passes", berlin, Weekly("1111111", 2, 30),
         "@" + std::to_string(Utc(2024, 10, 27, 1, 10)), "2024-10-28 02:30",
         "@" + std::to_string(Utc(2024, 10, 27, 1, 30))},
        {"02:30 skipped: the jump at 03:00", berlin, Weekly("1111111", 2, 30), "2024-03-30 12:00",
         "2024-03-31 03:00", "2024-03-31 03:30"},
        // Lord Howe moves its clocks by 30 minutes: 6 October 2024 02:00 -> 02:30.
        {"02:10 skipped by half an hour", "Australia/Lord_Howe", Weekly("1111111", 2, 10),
         "2024-10-05 12:30", "2024-10-06 02:30", "2024-10-06 02:40"},
    };
    for (const EdgeCase& c : cases) {
        ScopedTZ tz(c.zone);
        const long now = At(c.now);
        for (bool compatible : {false, true}) {
            LogCapture log;
            const std::string& want = compatible && !c.compatible.empty() ? c.compatible : c.next;
            EXPECT_EQ(At(want), compatible ? c.schedule.GetNextScheduledSeconds(now)
                                           : c.schedule.NextRunAfter(now))
                << c.zone << ": " << c.what << (compatible ? " (compatible)" : "");
            EXPECT_EQ(c.log, Logged(log)) << c.what;
        }
    }
}

// The differential check: the days a schedule runs on come from civil-calendar arithmetic (a
// begin day the month lacks rolls over into the next month; monthly and yearly runs count from
// the current month or year on); a day's first run is the moment the local clock shows the start
// time; the repeats follow in plain seconds; the answer is the first run strictly after `now`.
// Where the zone never changes its clocks the compatible computation must agree too, but for a
// yearly 29 February (which it counts on from 1 March).

int DaysInMonth(long y, int m) {
    return static_cast<int>(DaysFromCivil(y, m + 1, 1) - DaysFromCivil(y, m, 1));
}

// The run days from `today` on, in order, far enough ahead for every mode to have a run.
std::vector<long> RunDays(const Schedule& s, long today) {
    const struct tm now = CivilFromDays(today);
    std::vector<long> days;
    for (long i = 0; i < 26; ++i) {
        long day = 0;
        switch (s.GetMode()) {
            case S2S::SCHD_WEEKLY:
                day = s.GetWeekSchedule()[CivilFromDays(today + i).tm_wday] == '1' ? today + i : 0;
                break;
            case S2S::SCHD_MONTHLY:
                day = DaysFromCivil(now.tm_year + 1900, now.tm_mon + 1 + i, s.GetBeginDay());
                break;
            case S2S::SCHD_YEARLY:
                day = DaysFromCivil(now.tm_year + 1900 + i, s.GetBeginMonth(), s.GetBeginDay());
                break;
            case S2S::SCHD_ONCE:
                day =
                    i > 0 ? 0 : DaysFromCivil(s.GetBeginYear(), s.GetBeginMonth(), s.GetBeginDay());
                break;
            default:
                break;
        }
        if (day >= today) {
            days.push_back(day);
        }
    }
    return days;
}

long ExpectedNextRun(const Schedule& s, long now) {
    const long start = s.GetStartHour() * 3600L + s.GetStartMinute() * 60L;
    const long local = now + s2s_test::GmtOffsetAt(now);
    const long today = local / 86400 - (local % 86400 < 0 ? 1 : 0);
    for (long day : RunDays(s, today)) {
        const long first = s2s_test::LocalMoment(day, start);
        for (long k = 0; k <= s.GetRepeatTimesInDay(); ++k) {
            if (first + k * s.GetPeriodSeconds() > now) {
                return first + k * s.GetPeriodSeconds();
            }
        }
    }
    return 0;  // only "once" runs out of days
}

// Moments where the UTC offset changes between two moments, to the second.
std::vector<long> ClockChanges(long from, long to) {
    std::vector<long> changes;
    for (long t = from + 21600; t <= to; t += 21600) {
        long lo = t - 21600, hi = t;
        if (s2s_test::GmtOffsetAt(lo) != s2s_test::GmtOffsetAt(hi)) {
            while (hi - lo > 1) {
                long mid = lo + (hi - lo) / 2;
                (s2s_test::GmtOffsetAt(mid) == s2s_test::GmtOffsetAt(lo) ? lo : hi) = mid;
            }
            changes.push_back(hi);
        }
    }
    return changes;
}

// Schedules and moments biased towards where faults hide: the small hours (clock changes), 23:xx
// (day ends), month ends, 29 February, the days around clock changes and around the begin date.
struct Generator {
    long Uniform(long lo, long hi) { return std::uniform_int_distribution<long>(lo, hi)(rng); }
    bool Chance(int percent) { return Uniform(1, 100) <= percent; }
    template <typename T>
    T Pick(std::initializer_list<T> values) {
        return values.begin()[Uniform(0, static_cast<long>(values.size()) - 1)];
    }

    Schedule MakeSchedule() {
        const auto mode = Pick({S2S::SCHD_WEEKLY, S2S::SCHD_WEEKLY, S2S::SCHD_MONTHLY,
                                S2S::SCHD_MONTHLY, S2S::SCHD_YEARLY, S2S::SCHD_ONCE});
        const int hour = static_cast<int>(Chance(50) ? Pick({0, 1, 2, 2, 3, 23}) : Uniform(0, 23));
        const int minute = static_cast<int>(Chance(50) ? Pick({0, 30, 59}) : Uniform(0, 59));
        const long repeat = Chance(50) ? 0 : Chance(50) ? Uniform(1, 4) : Uniform(1, 95);
        const long most = repeat == 0 ? 0 : (86399 - hour * 3600L - minute * 60L) / repeat;
        const long period =
            most < 60 ? 0
                      : std::min(most, Chance(50) ? Pick<long>({60, 900, 1800, 3600, 5400})
                                                  : Uniform(60, most));
        const bool leap_day = Chance(10);  // for yearly and once
        const long year = leap_day ? Pick<long>({2016, 2020, 2024, 2028}) : Uniform(2015, 2030);
        const int month = leap_day ? 2 : static_cast<int>(Uniform(1, 12));
        const int last = DaysInMonth(year, month);
        const long day = Chance(60) ? std::max(1L, last - Uniform(0, 3)) : Uniform(1, last);
        Schedule s = Dated(mode, static_cast<int>(year), month, static_cast<int>(day), hour, minute,
                           period, period == 0 ? 0 : repeat);
        std::string week = "0000000";  // none chosen reads as every day
        for (char& c : week) {
            c = Chance(40) ? '1' : '0';
        }
        s.SetWeekSchedule(week);
        return s;
    }

    long MakeNow(const Schedule& s, const std::vector<long>& changes) {
        const long y = Uniform(2020, 2030);
        const int m = static_cast<int>(Uniform(1, 12));
        switch (Uniform(0, 3)) {
            case 0:
                if (!changes.empty()) {
                    return changes[static_cast<size_t>(
                               Uniform(0, static_cast<long>(changes.size()) - 1))] +
                           Uniform(-3 * 86400, 3 * 86400);
                }
                break;
            case 1:  // around a month end
                return Utc(y, m, DaysInMonth(y, m), 0, 0) + Uniform(-86400, 2 * 86400);
            case 2:  // around the begin date (once, yearly)
                return Utc(s.GetBeginYear(), s.GetBeginMonth(), s.GetBeginDay(), 0, 0) +
                       Uniform(-2 * 86400, 2 * 86400);
        }
        return Uniform(Utc(2020, 1, 1, 0, 0), Utc(2030, 12, 31, 0, 0));
    }

    std::mt19937 rng;
};

class ScheduleDifferential : public ::testing::TestWithParam<const char*> {};

TEST_P(ScheduleDifferential, AgreesWithCalendarArithmetic) {
    ScopedTZ tz(GetParam());
    const std::vector<long> changes = ClockChanges(Utc(2020, 1, 1, 0, 0), Utc(2031, 1, 1, 0, 0));
    Generator gen{std::mt19937(20240331u + static_cast<unsigned>(std::string(GetParam()).size()))};
    int failures = 0;
    for (int i = 0; i < 4000 && failures < 10; ++i) {
        const Schedule s = gen.MakeSchedule();
        ASSERT_TRUE(s.Validate()) << s;
        const long now = gen.MakeNow(s, changes);
        const long first = std::max(ExpectedNextRun(s, now), now + 1);  // asked around it too
        for (long at : {now, first - 1, first, first + 1}) {
            const long expected = ExpectedNextRun(s, at), actual = s.NextRunAfter(at);
            if (changes.empty() && !(s.GetMode() == S2S::SCHD_YEARLY && s.GetBeginDay() == 29 &&
                                     s.GetBeginMonth() == 2)) {
                EXPECT_EQ(actual, s.GetNextScheduledSeconds(at)) << s << "\nnow: " << at;
            }
            failures += actual != expected;
            EXPECT_EQ(expected, actual) << GetParam() << ", off by " << actual - expected << " s\n"
                                        << s << "\nnow: " << at;
        }
    }
}

INSTANTIATE_TEST_SUITE_P(TimeZones, ScheduleDifferential,
                         ::testing::Values("UTC", "Europe/Berlin", "America/New_York",
                                           "Australia/Sydney", "Australia/Adelaide",
                                           "Australia/Lord_Howe", "Asia/Kolkata",
                                           "America/Santiago"));

}  // namespace
