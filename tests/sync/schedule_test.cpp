// Schedule: coupled setters, week normalisation, mode texts, validation with its exact NOTE
// lines, and the next run for every mode, at and around run times, month and year ends, 29
// February, and across clock changes in several time zones.
#include <gtest/gtest.h>

#include <climits>
#include <string>
#include <vector>

#include "s2s_sync_obj.h"
#include "sync/sync_test_util.h"

namespace {

using S2S::Schedule;
using s2s_test::Local;
using s2s_test::LogCapture;
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
// Next run: special modes and error paths

TEST(ScheduleNextRun, ManualRealtimeAndNegativeNow) {
    ScopedTZ tz("UTC");
    const long now = Utc(2024, 5, 1, 12, 0);
    EXPECT_EQ(0, Make(S2S::SCHD_MANUAL, 8, 0).GetNextScheduledSeconds(now));
    EXPECT_EQ(now + 1, Make(S2S::SCHD_REALTIME, 8, 0).GetNextScheduledSeconds(now));
    EXPECT_EQ(-1, Make(S2S::SCHD_REALTIME, 8, 0).GetNextScheduledSeconds(-1));
    EXPECT_EQ(-1, Make(S2S::SCHD_MANUAL, 8, 0).GetNextScheduledSeconds(-5));
}

TEST(ScheduleNextRun, UnknownModeLogsTwoErrors) {
    ScopedTZ tz("UTC");
    LogCapture log;
    Schedule s = Make(static_cast<S2S::SCHD_MODE>(6), 8, 0);
    EXPECT_EQ(-1, s.GetNextScheduledSeconds(Utc(2024, 5, 1, 12, 0)));
    EXPECT_EQ(
        "[ERROR] s2s_sync_obj.cpp(93): Unknown schedule mode [6]\n"
        "[ERROR] s2s_sync_obj.cpp(117): Fail to align to scheduled day\n",
        log.Text());
}

TEST(ScheduleNextRun, NowBeyondTheCalendarFailsWithReferenceSeconds) {
    ScopedTZ tz("UTC");
    LogCapture log;
    Schedule s = Weekly("1111111", 8, 0);
    EXPECT_EQ(-1, s.GetNextScheduledSeconds(LONG_MAX));
    // localtime cannot express the time, so the zeroed fields (day 0 of January 1900) are used.
    EXPECT_EQ(
        "[ERROR] s2s_sync_obj.cpp(128): Fail to get reference seconds, year:[-1], mon:[11], "
        "mday:[31], hour:[0], min:[0], sec:[0], dst:[0]\n",
        log.Text());
}

TEST(ScheduleNextRun, OnceBeforeTheEpochFailsWithScheduledSeconds) {
    ScopedTZ tz("UTC");
    LogCapture log;
    Schedule s = Dated(S2S::SCHD_ONCE, 1960, 1, 1, 8, 0);
    EXPECT_EQ(-1, s.GetNextScheduledSeconds(Utc(2024, 1, 1, 12, 0)));
    EXPECT_EQ(
        "[ERROR] s2s_sync_obj.cpp(139): Fail to get scheduled seconds, year:[60], mon:[0], "
        "mday:[1], hour:[12], min:[0], sec:[0], dst:[0]\n",
        log.Text());
}

TEST(ScheduleNextRun, DayBeforeTheEpochIsSkippedNotFatal) {
    // At the epoch it is still 31 December 1969 in New York; that day's 08:00 cannot be
    // expressed, so the run is the next day's.
    ScopedTZ tz("America/New_York");
    LogCapture log;
    Schedule s = Weekly("1111111", 8, 0);
    EXPECT_EQ(Utc(1970, 1, 1, 13, 0), s.GetNextScheduledSeconds(0));
    EXPECT_EQ(
        "[ERROR] s2s_sync_obj.cpp(209): Fail to get scheduled seconds, year:[69], mon:[11], "
        "mday:[31], hour:[8], min:[0], sec:[0], dst:[0]\n",
        log.Text());
}

TEST(ScheduleNextRun, NothingIsLoggedOnTheOrdinaryPath) {
    ScopedTZ tz("Europe/Berlin");
    LogCapture log;
    for (int mode = 2; mode <= 5; ++mode) {
        Schedule s = Dated(static_cast<S2S::SCHD_MODE>(mode), 2024, 3, 31, 2, 30, 1800, 3);
        EXPECT_GT(s.GetNextScheduledSeconds(Utc(2024, 3, 30, 12, 0)), 0) << mode;
    }
    EXPECT_EQ("", log.Text());
}

// ---------------------------------------------------------------------------------------------
// Next run: the same wall-clock cases in every time zone

struct Wall {
    int y, mo, d, h, mi, s;
};

struct WallCase {
    const char* what;
    Schedule schedule;
    Wall now;
    Wall next;  // year 0: no next run (0)
};

std::vector<WallCase> WallCases() {
    const Wall none{0, 0, 0, 0, 0, 0};
    Schedule repeated = Weekly("1111111", 8, 0, 3600, 2);  // 08:00, 09:00, 10:00
    Schedule monthly31 = Dated(S2S::SCHD_MONTHLY, 2014, 1, 31, 9, 0);
    Schedule leap_yearly = Dated(S2S::SCHD_YEARLY, 2024, 2, 29, 6, 0);
    Schedule once_leap = Dated(S2S::SCHD_ONCE, 2024, 2, 29, 9, 0);
    Schedule once_repeated = Dated(S2S::SCHD_ONCE, 2024, 6, 10, 8, 0, 3600, 2);
    Schedule evening = Dated(S2S::SCHD_MONTHLY, 2014, 1, 1, 22, 0, 1800, 3);
    return {
        // weekly
        {"Sunday only, today's run past",
         Weekly("1000000", 9, 0),
         {2024, 1, 14, 10, 0, 0},
         {2024, 1, 21, 9, 0, 0}},
        {"Saturday only, from Sunday",
         Weekly("0000001", 9, 0),
         {2024, 1, 14, 10, 0, 0},
         {2024, 1, 20, 9, 0, 0}},
        {"Sunday only, today's run ahead",
         Weekly("1000000", 9, 0),
         {2024, 1, 14, 8, 59, 59},
         {2024, 1, 14, 9, 0, 0}},
        {"repeats: before the first", repeated, {2024, 1, 15, 7, 59, 59}, {2024, 1, 15, 8, 0, 0}},
        {"repeats: at the first", repeated, {2024, 1, 15, 8, 0, 0}, {2024, 1, 15, 9, 0, 0}},
        {"repeats: just before the second",
         repeated,
         {2024, 1, 15, 8, 59, 59},
         {2024, 1, 15, 9, 0, 0}},
        {"repeats: at the second", repeated, {2024, 1, 15, 9, 0, 0}, {2024, 1, 15, 10, 0, 0}},
        {"repeats: just after the second",
         repeated,
         {2024, 1, 15, 9, 0, 1},
         {2024, 1, 15, 10, 0, 0}},
        {"repeats: at the last", repeated, {2024, 1, 15, 10, 0, 0}, {2024, 1, 16, 8, 0, 0}},
        {"Friday only across the year end",
         Weekly("0000010", 0, 0),
         {2026, 12, 31, 12, 0, 0},
         {2027, 1, 1, 0, 0, 0}},
        {"Friday only, at the run",
         Weekly("0000010", 0, 0),
         {2027, 1, 1, 0, 0, 0},
         {2027, 1, 8, 0, 0, 0}},
        {"daily at 23:59 on New Year's Eve",
         Weekly("1111111", 23, 59),
         {2024, 12, 31, 23, 59, 0},
         {2025, 1, 1, 23, 59, 0}},
        {"29 February is an ordinary Thursday",
         Weekly("0000100", 12, 0),
         {2024, 2, 28, 12, 0, 0},
         {2024, 2, 29, 12, 0, 0}},
        // monthly: a begin day the month lacks rolls into the next month
        {"31st after a 30-day month", monthly31, {2023, 4, 15, 12, 0, 0}, {2023, 5, 1, 9, 0, 0}},
        {"31st: after the rolled run", monthly31, {2023, 5, 1, 9, 0, 0}, {2023, 5, 31, 9, 0, 0}},
        {"31st in a common February", monthly31, {2023, 2, 10, 0, 0, 0}, {2023, 3, 3, 9, 0, 0}},
        {"31st in a leap February", monthly31, {2024, 2, 10, 0, 0, 0}, {2024, 3, 2, 9, 0, 0}},
        {"30th in a common February",
         Dated(S2S::SCHD_MONTHLY, 2014, 1, 30, 9, 0),
         {2023, 2, 10, 0, 0, 0},
         {2023, 3, 2, 9, 0, 0}},
        {"30th in a leap February",
         Dated(S2S::SCHD_MONTHLY, 2014, 1, 30, 9, 0),
         {2024, 2, 10, 0, 0, 0},
         {2024, 3, 1, 9, 0, 0}},
        {"29th in a common February",
         Dated(S2S::SCHD_MONTHLY, 2014, 1, 29, 9, 0),
         {2023, 2, 10, 0, 0, 0},
         {2023, 3, 1, 9, 0, 0}},
        {"29th in a leap February",
         Dated(S2S::SCHD_MONTHLY, 2014, 1, 29, 9, 0),
         {2024, 2, 10, 0, 0, 0},
         {2024, 2, 29, 9, 0, 0}},
        // The month being looked at is the current one: once March has begun, February's run
        // (rolled to 3 March) is not run late.
        {"31st: February's roll-over is not made up",
         monthly31,
         {2023, 3, 2, 10, 0, 0},
         {2023, 3, 31, 9, 0, 0}},
        {"31st at the run on New Year's Eve",
         monthly31,
         {2023, 12, 31, 9, 0, 0},
         {2024, 1, 31, 9, 0, 0}},
        {"15th across the year end",
         Dated(S2S::SCHD_MONTHLY, 2014, 1, 15, 9, 0),
         {2024, 12, 20, 0, 0, 0},
         {2025, 1, 15, 9, 0, 0}},
        {"monthly repeats: at the third", evening, {2024, 1, 1, 23, 0, 0}, {2024, 1, 1, 23, 30, 0}},
        {"monthly repeats: at the last", evening, {2024, 1, 1, 23, 30, 0}, {2024, 2, 1, 22, 0, 0}},
        // yearly: 29 February falls on 1 March in common years
        {"29 February in a common year",
         leap_yearly,
         {2025, 1, 10, 0, 0, 0},
         {2025, 3, 1, 6, 0, 0}},
        {"29 February: at the common-year run",
         leap_yearly,
         {2025, 3, 1, 6, 0, 0},
         {2026, 3, 1, 6, 0, 0}},
        {"29 February: the next leap year",
         leap_yearly,
         {2027, 3, 2, 0, 0, 0},
         {2028, 2, 29, 6, 0, 0}},
        {"29 February: a second before",
         leap_yearly,
         {2028, 2, 29, 5, 59, 59},
         {2028, 2, 29, 6, 0, 0}},
        {"31 December: a second before",
         Dated(S2S::SCHD_YEARLY, 2014, 12, 31, 23, 59),
         {2024, 12, 31, 23, 58, 59},
         {2024, 12, 31, 23, 59, 0}},
        {"31 December: at the run",
         Dated(S2S::SCHD_YEARLY, 2014, 12, 31, 23, 59),
         {2024, 12, 31, 23, 59, 0},
         {2025, 12, 31, 23, 59, 0}},
        {"1 January from the last second of the year",
         Dated(S2S::SCHD_YEARLY, 2014, 1, 1, 0, 0),
         {2024, 12, 31, 23, 59, 59},
         {2025, 1, 1, 0, 0, 0}},
        // once
        {"once: the day before", once_leap, {2024, 2, 28, 12, 0, 0}, {2024, 2, 29, 9, 0, 0}},
        {"once: a second before", once_leap, {2024, 2, 29, 8, 59, 59}, {2024, 2, 29, 9, 0, 0}},
        {"once: at the run", once_leap, {2024, 2, 29, 9, 0, 0}, none},
        {"once: the day after", once_leap, {2024, 3, 1, 0, 0, 0}, none},
        {"once: a year ahead", once_leap, {2023, 1, 1, 0, 0, 0}, {2024, 2, 29, 9, 0, 0}},
        {"once with repeats: between",
         once_repeated,
         {2024, 6, 10, 9, 30, 0},
         {2024, 6, 10, 10, 0, 0}},
        {"once with repeats: at the last", once_repeated, {2024, 6, 10, 10, 0, 0}, none},
        {"once: begin long past", Make(S2S::SCHD_ONCE, 0, 0), {2024, 6, 10, 0, 0, 0}, none},
    };
}

class ScheduleZones : public ::testing::TestWithParam<const char*> {};

TEST_P(ScheduleZones, WallClockCases) {
    ScopedTZ tz(GetParam());
    LogCapture log;
    for (const WallCase& c : WallCases()) {
        const long now = Local(c.now.y, c.now.mo, c.now.d, c.now.h, c.now.mi, c.now.s);
        const long expected =
            c.next.y == 0 ? 0 : Local(c.next.y, c.next.mo, c.next.d, c.next.h, c.next.mi, c.next.s);
        EXPECT_TRUE(c.schedule.Validate()) << c.what;
        EXPECT_EQ(expected, c.schedule.GetNextScheduledSeconds(now)) << c.what;
    }
    EXPECT_EQ("", log.Text());
}

INSTANTIATE_TEST_SUITE_P(TimeZones, ScheduleZones,
                         ::testing::Values("UTC", "Europe/Berlin", "America/New_York",
                                           "Australia/Sydney", "Australia/Adelaide",
                                           "Australia/Lord_Howe", "Asia/Kolkata"),
                         [](const ::testing::TestParamInfo<const char*>& info) {
                             std::string name = info.param;
                             for (char& ch : name) {
                                 ch = std::isalnum(static_cast<unsigned char>(ch)) ? ch : '_';
                             }
                             return name;
                         });

// ---------------------------------------------------------------------------------------------
// Next run: clock changes, with the expected moments written in UTC

struct DstCase {
    const char* what;
    Schedule schedule;
    long now;       // UTC seconds
    long expected;  // UTC seconds
};

void RunDstCases(const char* zone, const std::vector<DstCase>& cases) {
    ScopedTZ tz(zone);
    LogCapture log;
    for (const DstCase& c : cases) {
        EXPECT_TRUE(c.schedule.Validate()) << zone << ": " << c.what;
        EXPECT_EQ(c.expected, c.schedule.GetNextScheduledSeconds(c.now)) << zone << ": " << c.what;
    }
    EXPECT_EQ("", log.Text());
}

// Berlin 2024: 31 March 02:00 CET -> 03:00 CEST (01:00 UTC); 27 October 03:00 CEST -> 02:00 CET
// (01:00 UTC).
TEST(ScheduleClockChange, EuropeBerlin) {
    Schedule daily9 = Weekly("1111111", 9, 0);
    Schedule skipped = Weekly("1111111", 2, 30);
    Schedule repeated = Weekly("1111111", 2, 30);
    Schedule over_fall = Weekly("1111111", 1, 0, 3600, 3);
    Schedule over_spring = Weekly("1111111", 1, 0, 3600, 2);
    Schedule monday9 = Weekly("0100000", 9, 0);
    RunDstCases(
        "Europe/Berlin",
        {
            // Computed the evening before, the run keeps its wall-clock time after the change.
            {"09:00 on the day the clocks go back", daily9, Utc(2024, 10, 26, 21, 0),
             Utc(2024, 10, 27, 8, 0)},
            {"09:00 on the day the clocks go forward", daily9, Utc(2024, 3, 30, 22, 0),
             Utc(2024, 3, 31, 7, 0)},
            {"09:00 the day after going back", daily9, Utc(2024, 10, 27, 8, 0),
             Utc(2024, 10, 28, 8, 0)},
            // A start inside the skipped hour runs just after the jump, once.
            {"02:30 skipped, from the day before", skipped, Utc(2024, 3, 30, 11, 0),
             Utc(2024, 3, 31, 1, 30)},
            {"02:30 skipped, a second before the jump", skipped, Utc(2024, 3, 31, 0, 59, 59),
             Utc(2024, 3, 31, 1, 30)},
            {"02:30 skipped, right after the jump", skipped, Utc(2024, 3, 31, 1, 0),
             Utc(2024, 3, 31, 1, 30)},
            {"02:30 skipped, at its run", skipped, Utc(2024, 3, 31, 1, 30), Utc(2024, 4, 1, 0, 30)},
            // A start inside the repeated hour runs at its first occurrence only.
            {"02:30 repeated, from the day before", repeated, Utc(2024, 10, 26, 10, 0),
             Utc(2024, 10, 27, 0, 30)},
            {"02:30 repeated, at its first occurrence", repeated, Utc(2024, 10, 27, 0, 30),
             Utc(2024, 10, 28, 1, 30)},
            {"02:30 repeated, during the second pass", repeated, Utc(2024, 10, 27, 1, 10),
             Utc(2024, 10, 28, 1, 30)},
            // Repeats are plain seconds apart across the change.
            {"hourly from 01:00 over going back: first", over_fall, Utc(2024, 10, 26, 22, 0),
             Utc(2024, 10, 26, 23, 0)},
            {"hourly over going back: second", over_fall, Utc(2024, 10, 26, 23, 0),
             Utc(2024, 10, 27, 0, 0)},
            {"hourly over going back: third", over_fall, Utc(2024, 10, 27, 0, 0),
             Utc(2024, 10, 27, 1, 0)},
            {"hourly over going back: fourth", over_fall, Utc(2024, 10, 27, 1, 0),
             Utc(2024, 10, 27, 2, 0)},
            {"hourly over going back: next day", over_fall, Utc(2024, 10, 27, 2, 0),
             Utc(2024, 10, 28, 0, 0)},
            {"hourly from 01:00 over going forward: second", over_spring, Utc(2024, 3, 31, 0, 0),
             Utc(2024, 3, 31, 1, 0)},
            {"hourly over going forward: third", over_spring, Utc(2024, 3, 31, 1, 0),
             Utc(2024, 3, 31, 2, 0)},
            {"hourly over going forward: next day", over_spring, Utc(2024, 3, 31, 2, 0),
             Utc(2024, 3, 31, 23, 0)},
            // Late-evening computations across a change keep the aligned date.
            {"monthly 31st from 1 March 23:45", Dated(S2S::SCHD_MONTHLY, 2014, 1, 31, 10, 0),
             Utc(2024, 3, 1, 22, 45), Utc(2024, 3, 31, 8, 0)},
            {"Mondays from Saturday 23:30 before going forward", monday9, Utc(2024, 3, 30, 22, 30),
             Utc(2024, 4, 1, 7, 0)},
            {"Mondays from Saturday 00:30 before going back", monday9, Utc(2024, 10, 25, 22, 30),
             Utc(2024, 10, 28, 8, 0)},
            {"yearly on the skipped 02:30", Dated(S2S::SCHD_YEARLY, 2024, 3, 31, 2, 30),
             Utc(2024, 1, 1, 0, 0), Utc(2024, 3, 31, 1, 30)},
            {"once at the repeated 02:30", Dated(S2S::SCHD_ONCE, 2024, 10, 27, 2, 30),
             Utc(2024, 10, 1, 0, 0), Utc(2024, 10, 27, 0, 30)},
            {"once at the repeated 02:30, after it", Dated(S2S::SCHD_ONCE, 2024, 10, 27, 2, 30),
             Utc(2024, 10, 27, 0, 30), 0},
        });
}

// New York 2024: 10 March 02:00 EST -> 03:00 EDT (07:00 UTC); 3 November 02:00 EDT -> 01:00 EST
// (06:00 UTC).
TEST(ScheduleClockChange, AmericaNewYork) {
    Schedule daily9 = Weekly("1111111", 9, 0);
    Schedule skipped = Weekly("1111111", 2, 30);
    Schedule repeated = Weekly("1111111", 1, 30);
    RunDstCases("America/New_York", {
                                        {"09:00 on the day the clocks go back", daily9,
                                         Utc(2024, 11, 3, 3, 0), Utc(2024, 11, 3, 14, 0)},
                                        {"09:00 on the day the clocks go forward", daily9,
                                         Utc(2024, 3, 10, 4, 0), Utc(2024, 3, 10, 13, 0)},
                                        {"02:30 skipped, from the day before", skipped,
                                         Utc(2024, 3, 9, 17, 0), Utc(2024, 3, 10, 7, 30)},
                                        {"02:30 skipped, at its run", skipped,
                                         Utc(2024, 3, 10, 7, 30), Utc(2024, 3, 11, 6, 30)},
                                        {"01:30 repeated, from the day before", repeated,
                                         Utc(2024, 11, 2, 16, 0), Utc(2024, 11, 3, 5, 30)},
                                        {"01:30 repeated, at its first occurrence", repeated,
                                         Utc(2024, 11, 3, 5, 30), Utc(2024, 11, 4, 6, 30)},
                                        {"01:30 repeated, during the second pass", repeated,
                                         Utc(2024, 11, 3, 6, 10), Utc(2024, 11, 4, 6, 30)},
                                    });
}

// Sydney 2024: 7 April 03:00 AEDT -> 02:00 AEST (16:00 UTC the day before); 6 October 02:00 AEST
// -> 03:00 AEDT (16:00 UTC the day before).
TEST(ScheduleClockChange, AustraliaSydney) {
    Schedule daily9 = Weekly("1111111", 9, 0);
    Schedule half_past_two = Weekly("1111111", 2, 30);
    RunDstCases("Australia/Sydney",
                {
                    {"09:00 on the day the clocks go back", daily9, Utc(2024, 4, 6, 12, 0),
                     Utc(2024, 4, 6, 23, 0)},
                    {"02:30 repeated, from the day before", half_past_two, Utc(2024, 4, 6, 1, 0),
                     Utc(2024, 4, 6, 15, 30)},
                    {"02:30 repeated, at its first occurrence", half_past_two,
                     Utc(2024, 4, 6, 15, 30), Utc(2024, 4, 7, 16, 30)},
                    {"02:30 skipped, from the day before", half_past_two, Utc(2024, 10, 5, 2, 0),
                     Utc(2024, 10, 5, 16, 30)},
                    {"02:30 skipped, at its run", half_past_two, Utc(2024, 10, 5, 16, 30),
                     Utc(2024, 10, 6, 15, 30)},
                    {"New Year's Eve in summer time", Dated(S2S::SCHD_YEARLY, 2014, 12, 31, 23, 59),
                     Utc(2024, 6, 1, 0, 0), Utc(2024, 12, 31, 12, 59)},
                });
}

// Lord Howe Island moves its clocks by 30 minutes: 7 April 2024 02:00 (+11) -> 01:30 (+10:30);
// 6 October 2024 02:00 (+10:30) -> 02:30 (+11).
TEST(ScheduleClockChange, AustraliaLordHowe) {
    RunDstCases("Australia/Lord_Howe",
                {
                    {"09:00 on the day the clocks go back", Weekly("1111111", 9, 0),
                     Utc(2024, 4, 6, 12, 0), Utc(2024, 4, 6, 22, 30)},
                    {"01:45 repeated, from the day before", Weekly("1111111", 1, 45),
                     Utc(2024, 4, 6, 1, 0), Utc(2024, 4, 6, 14, 45)},
                    {"01:45 repeated, at its first occurrence", Weekly("1111111", 1, 45),
                     Utc(2024, 4, 6, 14, 45), Utc(2024, 4, 7, 15, 15)},
                    {"02:10 skipped, from the day before", Weekly("1111111", 2, 10),
                     Utc(2024, 10, 5, 1, 30), Utc(2024, 10, 5, 15, 40)},
                });
}

// Adelaide has a half-hour standard offset: +09:30, +10:30 in summer, same change dates as
// Sydney.
TEST(ScheduleClockChange, AustraliaAdelaide) {
    RunDstCases("Australia/Adelaide",
                {
                    {"09:00 on the day the clocks go back", Weekly("1111111", 9, 0),
                     Utc(2024, 4, 6, 12, 30), Utc(2024, 4, 6, 23, 30)},
                    {"02:30 skipped, from the day before", Weekly("1111111", 2, 30),
                     Utc(2024, 10, 5, 2, 30), Utc(2024, 10, 5, 17, 0)},
                });
}

TEST(ScheduleClockChange, AsiaKolkataAndUtcHaveNone) {
    RunDstCases("Asia/Kolkata", {{"daily 09:00 on a European change day", Weekly("1111111", 9, 0),
                                  Utc(2024, 3, 30, 18, 30), Utc(2024, 3, 31, 3, 30)}});
    RunDstCases("UTC", {{"daily 02:30 on a European change day", Weekly("1111111", 2, 30),
                         Utc(2024, 3, 30, 12, 0), Utc(2024, 3, 31, 2, 30)}});
}

}  // namespace
