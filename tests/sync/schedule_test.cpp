// Schedule: coupled setters, week normalisation, mode texts, validation with its exact NOTE
// lines, and the next run for every mode, at and around run times, month and year ends, 29
// February, and across clock changes in several time zones.
#include <gtest/gtest.h>

#include <climits>
#include <cstdio>
#include <string>
#include <vector>

#include "s2s_sync_obj.h"
#include "sync/sync_test_util.h"

namespace {

using S2S::Schedule;
using s2s_test::Local;
using LogCapture = s2s_test::StampFreeLogCapture;
using s2s_test::ScopedTZ;
using s2s_test::Utc;

Schedule Make(S2S::SCHD_MODE mode, int hour, int minute, long period = 0, long repeat = 0) {
    Schedule s;
    s.SetMode(mode);
    s.SetStartHour(hour);
    s.SetStartMinute(minute);
    s.SetPeriod(period);
    s.SetRepeatTimesInDay(repeat);
    return s;
}

Schedule Weekly(const char* week, int hour, int minute, long period = 0, long repeat = 0) {
    Schedule s = Make(S2S::SCHD_WEEKLY, hour, minute, period, repeat);
    s.SetWeekSchedule(week);
    return s;
}

Schedule Dated(S2S::SCHD_MODE mode, int year, int month, int day, int hour, int minute,
               long period = 0, long repeat = 0) {
    Schedule s = Make(mode, hour, minute, period, repeat);
    s.SetBeginYear(year);
    s.SetBeginMonth(month);
    s.SetBeginDay(day);
    return s;
}

// ---------------------------------------------------------------------------------------------
// Fields, setters and texts

TEST(ScheduleFields, DefaultsAreManualEveryDayFrom2014AtMidnight) {
    Schedule s;
    EXPECT_EQ(S2S::SCHD_MANUAL, s.GetMode());
    EXPECT_EQ(0, s.GetPeriodSeconds());
    EXPECT_EQ(0, s.GetRepeatTimesInDay());
    EXPECT_EQ("1111111", s.GetWeekSchedule());
    EXPECT_EQ(2014, s.GetBeginYear());
    EXPECT_EQ(1, s.GetBeginMonth());
    EXPECT_EQ(1, s.GetBeginDay());
    EXPECT_EQ(0, s.GetStartHour());
    EXPECT_EQ(0, s.GetStartMinute());
    ScopedTZ tz("UTC");
    EXPECT_TRUE(s.Validate());
}

TEST(ScheduleFields, PeriodAndRepeatClearEachOtherOnZero) {
    Schedule s;
    s.SetPeriod(1800);
    s.SetRepeatTimesInDay(3);
    s.SetPeriod(0);
    EXPECT_EQ(0, s.GetRepeatTimesInDay());

    s.SetPeriod(1800);
    s.SetRepeatTimesInDay(3);
    s.SetRepeatTimesInDay(0);
    EXPECT_EQ(0, s.GetPeriodSeconds());

    // A non-zero value leaves the other alone, even when that one is 0.
    s.SetRepeatTimesInDay(4);
    EXPECT_EQ(0, s.GetPeriodSeconds());
    EXPECT_EQ(4, s.GetRepeatTimesInDay());
}

TEST(ScheduleFields, PeriodInHoursAndMinutesAndItsParts) {
    Schedule s;
    s.SetPeriod(1, 30);
    EXPECT_EQ(5400, s.GetPeriodSeconds());
    EXPECT_EQ(1, s.GetPeriodHourPart());
    EXPECT_EQ(30, s.GetPeriodMinutePart());
    s.SetPeriod(90);  // seconds below a minute are not reported
    EXPECT_EQ(0, s.GetPeriodHourPart());
    EXPECT_EQ(1, s.GetPeriodMinutePart());
    s.SetPeriod(25, 59);
    EXPECT_EQ(25, s.GetPeriodHourPart());
    EXPECT_EQ(59, s.GetPeriodMinutePart());
}

TEST(ScheduleFields, WeekScheduleIsNormalised) {
    Schedule s;
    s.SetWeekSchedule("0101010");
    EXPECT_EQ("0101010", s.GetWeekSchedule());
    s.SetWeekSchedule("000000");  // too short
    EXPECT_EQ("1111111", s.GetWeekSchedule());
    s.SetWeekSchedule("0101010");
    s.SetWeekSchedule("0000000");  // no day chosen means every day
    EXPECT_EQ("1111111", s.GetWeekSchedule());
    s.SetWeekSchedule("1x0000000");  // anything but "0" is chosen; the rest is ignored
    EXPECT_EQ("1100000", s.GetWeekSchedule());
    s.SetWeekSchedule("");
    EXPECT_EQ("1111111", s.GetWeekSchedule());
    s.SetWeekSchedule("0000001111");
    EXPECT_EQ("0000001", s.GetWeekSchedule());
}

TEST(ScheduleFields, ModeTexts) {
    const std::vector<std::pair<int, std::string>> table = {
        {0, "manual"}, {1, "realtime"}, {2, "weekly"}, {3, "monthly"},
        {4, "yearly"}, {5, "once"},     {6, "weekly"}, {-1, "weekly"}};
    for (const auto& [mode, text] : table) {
        Schedule s;
        s.SetMode(static_cast<S2S::SCHD_MODE>(mode));
        EXPECT_EQ(text, s.GetModeStr()) << mode;
    }
    const std::vector<std::pair<std::string, int>> parsed = {
        {"realtime", 1}, {"weekly", 2}, {"monthly", 3}, {"yearly", 4},  {"once", 5},
        {"manual", 0},   {"", 0},       {"Weekly", 0},  {"weekly ", 0}, {"daily", 0}};
    for (const auto& [text, mode] : parsed) {
        Schedule s;
        s.SetMode(S2S::SCHD_ONCE);
        s.SetModeByStr(text);
        EXPECT_EQ(mode, s.GetMode()) << "'" << text << "'";
    }
}

TEST(ScheduleFields, ScheduleBeginIsTheUnnormalisedBeginAtTheStartTime) {
    Schedule s = Dated(S2S::SCHD_ONCE, 2024, 4, 31, 7, 45);
    struct tm begin = s.GetScheduleBegin();
    EXPECT_EQ(124, begin.tm_year);
    EXPECT_EQ(3, begin.tm_mon);
    EXPECT_EQ(31, begin.tm_mday);
    EXPECT_EQ(7, begin.tm_hour);
    EXPECT_EQ(45, begin.tm_min);
    EXPECT_EQ(0, begin.tm_sec);
    EXPECT_EQ(0, begin.tm_isdst);
    EXPECT_EQ(0, begin.tm_wday);
    EXPECT_EQ(0, begin.tm_yday);
}

TEST(GetDaysToNextSync, CountsFromTodayAndWrapsTheWeek) {
    EXPECT_EQ(6, S2S::GetDaysToNextSync(0, "0000001"));  // Sunday to Saturday
    EXPECT_EQ(0, S2S::GetDaysToNextSync(3, "0001000"));  // today counts
    EXPECT_EQ(1, S2S::GetDaysToNextSync(6, "1000000"));  // Saturday to Sunday
    EXPECT_EQ(3, S2S::GetDaysToNextSync(5, "0100000"));  // Friday to Monday
    EXPECT_EQ(-1, S2S::GetDaysToNextSync(2, "0000000"));
    EXPECT_EQ(-1, S2S::GetDaysToNextSync(2, "xxxxxxx"));  // only "1" counts here
    EXPECT_EQ(-1, S2S::GetDaysToNextSync(0, ""));
    // Weekday numbers past 6 count modulo 7, without wrapping around 32 bits.
    EXPECT_EQ(1, S2S::GetDaysToNextSync(9, "0001000"));
    EXPECT_EQ(1, S2S::GetDaysToNextSync(4294967295u, "0000100"));  // 4294967295 mod 7 = 3
}

// ---------------------------------------------------------------------------------------------
// Validation: rules in order, each with its fixed NOTE line

struct ValidateCase {
    const char* what;
    Schedule schedule;
    std::string log;
};

TEST(ScheduleValidate, EachRuleLogsItsLineAndTheFirstBrokenRuleWins) {
    ScopedTZ tz("UTC");
    Schedule base;
    auto with = [&](auto change) {
        Schedule s = base;
        change(s);
        return s;
    };
    const std::string p = "[NOTE] s2s_sync_obj.cpp(";
    const std::vector<ValidateCase> cases = {
        {"hour 24", with([](Schedule& s) { s.SetStartHour(24); }),
         p + "325): Invalid begin hour\n"},
        {"negative hour, bad minute too", with([](Schedule& s) {
             s.SetStartHour(-1);
             s.SetStartMinute(60);
         }),
         p + "325): Invalid begin hour\n"},
        {"minute 60", with([](Schedule& s) { s.SetStartMinute(60); }),
         p + "329): Invalid begin minute\n"},
        {"negative minute", with([](Schedule& s) { s.SetStartMinute(-5); }),
         p + "329): Invalid begin minute\n"},
        {"period a day", with([](Schedule& s) { s.SetPeriod(86400); }),
         p + "334): Invalid period or repeat\n"},
        {"negative period", with([](Schedule& s) {
             s.SetPeriod(-60);
             s.SetRepeatTimesInDay(1);
         }),
         p + "334): Invalid period or repeat\n"},
        {"96 repeats", with([](Schedule& s) {
             s.SetPeriod(60);
             s.SetRepeatTimesInDay(96);
         }),
         p + "340): Invalid period\n"},
        {"negative repeats", with([](Schedule& s) {
             s.SetPeriod(60);
             s.SetRepeatTimesInDay(-1);
         }),
         p + "340): Invalid period\n"},
        {"last run past midnight", with([](Schedule& s) {
             s.SetStartHour(23);
             s.SetPeriod(1800);
             s.SetRepeatTimesInDay(2);
         }),
         p + "346): Invalid repeat in day [82800 + 1800 * 2]\n"},
        {"begin before 1970", with([](Schedule& s) { s.SetBeginYear(1960); }),
         p + "359): Invalid begin\n" + p + "367): 60 0 1 12 0 0\n"},
        {"29 February of a common year", with([](Schedule& s) {
             s.SetBeginMonth(2);
             s.SetBeginDay(29);
         }),
         p + "375): Invalid begin date\n"},
        {"31 April", with([](Schedule& s) {
             s.SetBeginMonth(4);
             s.SetBeginDay(31);
         }),
         p + "375): Invalid begin date\n"},
        {"month 13", with([](Schedule& s) { s.SetBeginMonth(13); }),
         p + "375): Invalid begin date\n"},
        {"day 0", with([](Schedule& s) { s.SetBeginDay(0); }), p + "375): Invalid begin date\n"},
        {"mode 6", with([](Schedule& s) { s.SetMode(static_cast<S2S::SCHD_MODE>(6)); }),
         p + "405): Invalid schedule mode [6]\n"},
        {"mode -1", with([](Schedule& s) { s.SetMode(static_cast<S2S::SCHD_MODE>(-1)); }),
         p + "405): Invalid schedule mode [-1]\n"},
    };
    for (const ValidateCase& c : cases) {
        LogCapture log;
        const Schedule before = c.schedule;
        EXPECT_FALSE(c.schedule.Validate()) << c.what;
        EXPECT_EQ(c.log, log.Text()) << c.what;
        EXPECT_EQ(before.GetPeriodSeconds(), c.schedule.GetPeriodSeconds());
    }
}

TEST(ScheduleValidate, LimitsThatPass) {
    ScopedTZ tz("Europe/Berlin");
    LogCapture log;
    Schedule s = Make(S2S::SCHD_WEEKLY, 23, 0, 1800, 1);  // 82800 + 1800 = 84600
    EXPECT_TRUE(s.Validate());
    s = Make(S2S::SCHD_WEEKLY, 23, 59, 59, 1);  // ends at 86399 exactly
    EXPECT_TRUE(s.Validate());
    s = Make(S2S::SCHD_WEEKLY, 0, 0, 86399, 1);
    EXPECT_TRUE(s.Validate());
    s = Make(S2S::SCHD_WEEKLY, 0, 0, 900, 95);
    EXPECT_TRUE(s.Validate());
    s = Dated(S2S::SCHD_ONCE, 2016, 2, 29, 23, 59);
    EXPECT_TRUE(s.Validate());
    // Begin dates on clock-change days are ordinary dates.
    s = Dated(S2S::SCHD_YEARLY, 2024, 3, 31, 2, 30);
    EXPECT_TRUE(s.Validate());
    s = Dated(S2S::SCHD_YEARLY, 2024, 10, 27, 2, 30);
    EXPECT_TRUE(s.Validate());
    // Every mode is checked the same way, even those that ignore the begin date.
    for (int mode = 0; mode <= 5; ++mode) {
        s.SetMode(static_cast<S2S::SCHD_MODE>(mode));
        EXPECT_TRUE(s.Validate()) << mode;
        s.SetBeginDay(30);
        s.SetBeginMonth(2);
        EXPECT_FALSE(s.Validate()) << mode;
        s.SetBeginMonth(3);
    }
    std::string text = log.Text();
    EXPECT_EQ(std::string::npos, text.find("Invalid repeat")) << text;
}

// ---------------------------------------------------------------------------------------------
// Next run: named edge cases, where both computations give the same answer and log the same lines

struct EdgeCase {
    const char* what;
    const char* zone;
    Schedule schedule;
    std::string now;   // local "YYYY-MM-DD HH:MM[:SS]", or "@SECONDS"
    std::string next;  // the same; "@0" no next run, "@-1" an error
    std::string log = "";
};

long At(const std::string& text) {
    if (text[0] == '@') {
        return std::stol(text.substr(1));
    }
    int y = 0, mo = 0, d = 0, h = 0, mi = 0, sec = 0;
    EXPECT_GE(std::sscanf(text.c_str(), "%d-%d-%d %d:%d:%d", &y, &mo, &d, &h, &mi, &sec), 5);
    return Local(y, mo, d, h, mi, sec);
}

TEST(ScheduleNextRun, NamedEdgeCases) {
    const std::string e = "[ERROR] s2s_sync_obj.cpp(";
    const std::string noon = "@" + std::to_string(Utc(2024, 5, 1, 12, 0));
    Schedule repeated = Weekly("1111111", 8, 0, 3600, 2);  // 08:00, 09:00, 10:00
    Schedule monthly31 = Dated(S2S::SCHD_MONTHLY, 2014, 1, 31, 9, 0);
    Schedule leap_yearly = Dated(S2S::SCHD_YEARLY, 2024, 2, 29, 6, 0);
    Schedule once_leap = Dated(S2S::SCHD_ONCE, 2024, 2, 29, 9, 0);
    const char* berlin = "Europe/Berlin";
    const char* new_york = "America/New_York";
    const std::vector<EdgeCase> cases = {
        {"manual never runs by itself", "UTC", Make(S2S::SCHD_MANUAL, 8, 0), noon, "@0"},
        {"realtime runs a second later", "UTC", Make(S2S::SCHD_REALTIME, 8, 0), noon,
         "@" + std::to_string(Utc(2024, 5, 1, 12, 0, 1))},
        {"a negative now is an error", "UTC", Make(S2S::SCHD_REALTIME, 8, 0), "@-1", "@-1"},
        {"an unknown mode cannot be aligned", "UTC", Make(static_cast<S2S::SCHD_MODE>(6), 8, 0),
         noon, "@-1",
         e + "93): Unknown schedule mode [6]\n" + e + "117): Fail to align to scheduled day\n"},
        // localtime cannot express the time, so the zeroed fields (day 0 of 1900) are used.
        {"now beyond the calendar", "UTC", Weekly("1111111", 8, 0), "@" + std::to_string(LONG_MAX),
         "@-1",
         e + "128): Fail to get reference seconds, year:[-1], mon:[11], mday:[31], hour:[0], "
             "min:[0], sec:[0], dst:[0]\n"},
        {"once before the epoch", "UTC", Dated(S2S::SCHD_ONCE, 1960, 1, 1, 8, 0),
         "2024-01-01 12:00", "@-1",
         e + "139): Fail to get scheduled seconds, year:[60], mon:[0], mday:[1], hour:[12], "
             "min:[0], sec:[0], dst:[0]\n"},
        // At the epoch it is still 31 December 1969 in New York; that day's 08:00 cannot be
        // expressed, so it is skipped.
        {"a day before the epoch is skipped", new_york, Weekly("1111111", 8, 0), "@0",
         "1970-01-01 08:00",
         e + "209): Fail to get scheduled seconds, year:[69], mon:[11], mday:[31], hour:[8], "
             "min:[0], sec:[0], dst:[0]\n"},
        {"Saturday only, from Sunday", berlin, Weekly("0000001", 9, 0), "2024-01-14 10:00",
         "2024-01-20 09:00"},
        {"Sunday only, today's run past", berlin, Weekly("1000000", 9, 0), "2024-01-14 10:00",
         "2024-01-21 09:00"},
        {"repeats: strictly after the second", berlin, repeated, "2024-01-15 09:00",
         "2024-01-15 10:00"},
        {"repeats: at the last", berlin, repeated, "2024-01-15 10:00", "2024-01-16 08:00"},
        {"daily 23:59 on New Year's Eve", "Australia/Sydney", Weekly("1111111", 23, 59),
         "2024-12-31 23:59", "2025-01-01 23:59"},
        {"the 31st after a 30-day month", new_york, monthly31, "2023-04-15 12:00",
         "2023-05-01 09:00"},
        {"the 31st in a common February", new_york, monthly31, "2023-02-10 00:00",
         "2023-03-03 09:00"},
        {"the 31st: February's roll-over is not made up", new_york, monthly31, "2023-03-04 10:00",
         "2023-03-31 09:00"},
        {"the 15th across the year end", "Asia/Kolkata",
         Dated(S2S::SCHD_MONTHLY, 2014, 1, 15, 9, 0), "2024-12-20 00:00", "2025-01-15 09:00"},
        {"29 February in a common year", berlin, leap_yearly, "2025-01-10 00:00",
         "2025-03-01 06:00"},
        {"29 February: at the common-year run", berlin, leap_yearly, "2025-03-01 06:00",
         "2026-03-01 06:00"},
        {"31 December: at the run", "Australia/Lord_Howe",
         Dated(S2S::SCHD_YEARLY, 2014, 12, 31, 23, 59), "2024-12-31 23:59", "2025-12-31 23:59"},
        {"once: a second before", berlin, once_leap, "2024-02-29 08:59:59", "2024-02-29 09:00"},
        {"once: at the run", berlin, once_leap, "2024-02-29 09:00", "@0"},
        {"once with repeats: at the last", "UTC", Dated(S2S::SCHD_ONCE, 2024, 6, 10, 8, 0, 3600, 2),
         "2024-06-10 10:00", "@0"},
    };
    for (const EdgeCase& c : cases) {
        ScopedTZ tz(c.zone);
        const long now = At(c.now);
        const long next = At(c.next);
        for (bool compatible : {false, true}) {
            LogCapture log;
            EXPECT_EQ(next, compatible ? c.schedule.GetNextScheduledSeconds(now)
                                       : c.schedule.NextRunAfter(now))
                << c.what << (compatible ? " (compatible)" : "");
            EXPECT_EQ(c.log, log.Text()) << c.what;
        }
    }
}

// ---------------------------------------------------------------------------------------------
// Next run on clock-change days: the compatible arithmetic keeps the daylight-saving flag of the
// day it started from; by the wall clock a start time is the local clock's. Moments in UTC.

struct ClockChangeCase {
    const char* what;
    const char* zone;
    Schedule schedule;
    long now;
    long compatible;
    long wall_clock;
};

TEST(ScheduleNextRun, CompatibleArithmeticOnClockChangeDays) {
    const char* berlin = "Europe/Berlin";
    const char* new_york = "America/New_York";
    const char* lord_howe = "Australia/Lord_Howe";
    Schedule daily9 = Weekly("1111111", 9, 0);
    Schedule monday9 = Weekly("0100000", 9, 0);
    Schedule leap_yearly = Dated(S2S::SCHD_YEARLY, 2024, 2, 29, 6, 0);
    const std::vector<ClockChangeCase> cases = {
        // Berlin 2024: 31 March 02:00 CET -> 03:00 CEST and 27 October 03:00 CEST -> 02:00 CET,
        // both at 01:00 UTC.
        {"09:00 after going back, from the evening before (summer flag kept: 08:00)", berlin,
         daily9, Utc(2024, 10, 26, 21, 0), Utc(2024, 10, 27, 7, 0), Utc(2024, 10, 27, 8, 0)},
        {"09:00 after going back, from that night (the day's own flag)", berlin, daily9,
         Utc(2024, 10, 27, 2, 0), Utc(2024, 10, 27, 8, 0), Utc(2024, 10, 27, 8, 0)},
        {"09:00 after going forward, from the evening before (winter flag kept: 10:00)", berlin,
         daily9, Utc(2024, 3, 30, 22, 0), Utc(2024, 3, 31, 8, 0), Utc(2024, 3, 31, 7, 0)},
        // Aligned at 23:30 with the winter flag, Monday night is read as Tuesday 00:30.
        {"Mondays, from Saturday 23:30 before going forward (runs Tuesday)", berlin, monday9,
         Utc(2024, 3, 30, 22, 30), Utc(2024, 4, 2, 7, 0), Utc(2024, 4, 1, 7, 0)},
        // Aligned at 00:30 with the summer flag, Monday is read as Sunday 23:30.
        {"Mondays, from Saturday 00:30 before going back (runs Sunday)", berlin, monday9,
         Utc(2024, 10, 25, 22, 30), Utc(2024, 10, 27, 8, 0), Utc(2024, 10, 28, 8, 0)},
        {"02:30 repeated, asked between its passes (runs again)", berlin, Weekly("1111111", 2, 30),
         Utc(2024, 10, 27, 1, 10), Utc(2024, 10, 27, 1, 30), Utc(2024, 10, 28, 1, 30)},
        {"02:30 skipped (03:30, or the jump at 03:00)", berlin, Weekly("1111111", 2, 30),
         Utc(2024, 3, 30, 11, 0), Utc(2024, 3, 31, 1, 30), Utc(2024, 3, 31, 1, 0)},
        // New York 2024: 10 March 02:00 EST -> 03:00 EDT (07:00 UTC); 3 November 02:00 EDT ->
        // 01:00 EST (06:00 UTC).
        {"09:00 after going back, from the evening before", new_york, daily9,
         Utc(2024, 11, 3, 3, 0), Utc(2024, 11, 3, 13, 0), Utc(2024, 11, 3, 14, 0)},
        {"09:00 after going forward, from the evening before", new_york, daily9,
         Utc(2024, 3, 10, 4, 0), Utc(2024, 3, 10, 14, 0), Utc(2024, 3, 10, 13, 0)},
        {"01:30 repeated, asked between its passes", new_york, Weekly("1111111", 1, 30),
         Utc(2024, 11, 3, 6, 10), Utc(2024, 11, 3, 6, 30), Utc(2024, 11, 4, 6, 30)},
        // Lord Howe moves its clocks by 30 minutes: 7 April 2024 02:00 (+11) -> 01:30 (+10:30),
        // 6 October 2024 02:00 (+10:30) -> 02:30 (+11), both at 15:00/15:30 UTC the day before.
        {"09:00 after going back, from the evening before", lord_howe, daily9,
         Utc(2024, 4, 6, 9, 0), Utc(2024, 4, 6, 22, 0), Utc(2024, 4, 6, 22, 30)},
        {"09:00 after going forward, from the evening before", lord_howe, daily9,
         Utc(2024, 10, 5, 9, 30), Utc(2024, 10, 5, 22, 30), Utc(2024, 10, 5, 22, 0)},
        {"02:10 skipped (02:40, or the jump at 02:30)", lord_howe, Weekly("1111111", 2, 10),
         Utc(2024, 10, 5, 1, 30), Utc(2024, 10, 5, 15, 40), Utc(2024, 10, 5, 15, 30)},
        // Yearly on 29 February: after a common year's run on 1 March the compatible arithmetic
        // counts on from 1 March and so misses the leap day.
        {"29 February, the year before a leap year", "UTC", leap_yearly, Utc(2027, 3, 2, 0, 0),
         Utc(2028, 3, 1, 6, 0), Utc(2028, 2, 29, 6, 0)},
    };
    for (const ClockChangeCase& c : cases) {
        ScopedTZ tz(c.zone);
        LogCapture log;
        EXPECT_TRUE(c.schedule.Validate()) << c.zone << ": " << c.what;
        EXPECT_EQ(c.compatible, c.schedule.GetNextScheduledSeconds(c.now))
            << c.zone << ": " << c.what;
        EXPECT_EQ(c.wall_clock, c.schedule.NextRunAfter(c.now)) << c.zone << ": " << c.what;
        EXPECT_EQ("", log.Text()) << c.zone << ": " << c.what;
    }
}

}  // namespace
