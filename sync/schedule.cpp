// Schedule: its setters, validation and the next-run arithmetic.
//
// The next run is found by walking local calendar days from `now`: align to the next day the mode
// allows, try that day's runs (the start time, then `repeat_times_in_day` more, `period` plain
// seconds apart), else move to the following day. Day lengths, month lengths and clock changes
// all come from the system's time-zone rules through mktime/localtime_r. One walk serves both
// answers: the compatible arithmetic (mktime as it stands) and the wall-clock one.
#include <climits>
#include <cstring>
#include <ctime>

#include "s2s_logger.h"
#include "s2s_sync_obj.h"
#include "sync/message_lines.h"

namespace S2S {

namespace {

constexpr unsigned kLastSecondOfDay = 86399;
constexpr unsigned kMaxRepeats = 95;
constexpr int kWeekDays = 7;
constexpr char kEveryDay[] = "1111111";

bool SameDate(const struct tm& a, const struct tm& b) {
    return a.tm_year == b.tm_year && a.tm_mon == b.tm_mon && a.tm_mday == b.tm_mday;
}

bool SameWallClock(const struct tm& a, const struct tm& b) {
    return SameDate(a, b) && a.tm_hour == b.tm_hour && a.tm_min == b.tm_min && a.tm_sec == b.tm_sec;
}

// Whether the UTC offset changes within a few hours of `when` (clock changes move the clocks by
// at most two hours).
bool NearOffsetChange(time_t when) {
    const time_t kWindow = 4 * 3600;
    time_t before = when - kWindow;
    time_t after = when + kWindow;
    struct tm at_before;
    struct tm at_after;
    if (localtime_r(&before, &at_before) == nullptr || localtime_r(&after, &at_after) == nullptr) {
        return true;
    }
    return at_before.tm_gmtoff != at_after.tm_gmtoff || at_before.tm_isdst != at_after.tm_isdst;
}

// The local wall-clock time of `t` counted as if it were UTC, for ordering wall-clock readings.
long WallSeconds(time_t t) {
    struct tm local;
    if (localtime_r(&t, &local) == nullptr) {
        return LONG_MIN;
    }
    return static_cast<long>(t) + local.tm_gmtoff;
}

// mktime for broken-down times built by date arithmetic, by wall-clock time. Their daylight-saving
// flag is left over from another day or another time of day, and mktime trusts it: a stale flag
// moves the result by the size of the clock change (09:00 on the day the clocks go back becomes
// 08:00; 23:30 on the day before they go forward becomes 00:30 of the next day, so a weekly run
// lands on the wrong day). So the flag is ignored and the wall-clock time decides:
// - a time that occurs once is that moment;
// - a time inside the repeated hour is its first occurrence, so a run happens once, not twice;
// - a time inside the skipped hour is the first instant after it, the moment the clocks jump
//   (02:30 on a 02:00 -> 03:00 night becomes 03:00), so the day still gets its run.
// With keep_date (date arithmetic, where only the day matters) a reading on the asked-for day is
// preferred, which matters only where the clocks jump across midnight.
// The result, like mktime's, is -1 when the time cannot be represented; `tm` is then left as
// mktime leaves it.
time_t ResolveLocal(struct tm& tm, bool keep_date) {
    // The wall-clock time asked for, with the calendar overflow resolved (31 April is 1 May).
    struct tm wanted = tm;
    wanted.tm_isdst = 0;
    const time_t wanted_wall = timegm(&wanted);
    const bool calendar_ok = wanted_wall != -1;

    // Away from any change of UTC offset a wall-clock time occurs exactly once, and mktime finds
    // it without a flag. That is nearly always the case, and it is cheap: mktime given a definite
    // flag that the zone never uses searches far and wide for a moment that has it.
    struct tm guess = tm;
    guess.tm_isdst = -1;
    time_t guess_secs = mktime(&guess);
    if (guess_secs == -1 || !calendar_ok ||
        (SameWallClock(guess, wanted) && !NearOffsetChange(guess_secs))) {
        tm = guess;
        return guess_secs;
    }

    // Near a change: read the wall clock both ways and choose.
    struct tm readings[2] = {tm, tm};
    readings[0].tm_isdst = 0;
    readings[1].tm_isdst = 1;
    time_t secs[2];
    for (int i = 0; i < 2; ++i) {
        secs[i] = mktime(&readings[i]);
    }
    if (secs[0] == -1 || secs[1] == -1) {
        tm = guess;
        return guess_secs;
    }
    const bool exact[2] = {SameWallClock(readings[0], wanted), SameWallClock(readings[1], wanted)};
    if (exact[0] || exact[1]) {
        // Both exact inside the repeated hour: the first occurrence.
        const int pick = exact[0] && exact[1] ? (secs[0] <= secs[1] ? 0 : 1) : (exact[0] ? 0 : 1);
        tm = readings[pick];
        return secs[pick];
    }
    // Skipped. The two readings lie on either side of the jump: one shows an earlier wall-clock
    // time than asked for, the other a later one. The jump is the first moment whose wall clock
    // has passed the time asked for.
    const int early = secs[0] <= secs[1] ? 0 : 1;
    time_t lo = secs[early];
    time_t hi = secs[1 - early];
    if (WallSeconds(lo) >= static_cast<long>(wanted_wall)) {
        tm = readings[early];
        return secs[early];
    }
    while (hi - lo > 1) {
        const time_t mid = lo + (hi - lo) / 2;
        (WallSeconds(mid) >= static_cast<long>(wanted_wall) ? hi : lo) = mid;
    }
    if (localtime_r(&hi, &tm) == nullptr) {
        tm = readings[1 - early];
        return secs[1 - early];
    }
    if (keep_date && !SameDate(tm, wanted) && SameDate(readings[early], wanted)) {
        tm = readings[early];
        return secs[early];
    }
    return hi;
}

void LogTimeFields(int line, const char* what, const struct tm& tm) {
    Logger::LogMsg(Logger::Error,
                   "[ERROR] s2s_sync_obj.cpp(%d): Fail to get %s seconds, year:[%d], mon:[%d], "
                   "mday:[%d], hour:[%d], min:[%d], sec:[%d], dst:[%d]\n",
                   line, what, tm.tm_year, tm.tm_mon, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec,
                   tm.tm_isdst);
}

}  // namespace

int GetDaysToNextSync(unsigned weekday, std::string week_schedule) {
    for (unsigned d = 0; d < kWeekDays; ++d) {
        size_t position =
            static_cast<size_t>((static_cast<unsigned long long>(weekday) + d) % kWeekDays);
        if (position < week_schedule.size() && week_schedule[position] == '1') {
            return static_cast<int>(d);
        }
    }
    return -1;
}

void Schedule::SetPeriod(long seconds) {
    period_ = static_cast<int>(seconds);
    if (seconds == 0) {
        repeat_times_in_day_ = 0;
    }
}

void Schedule::SetPeriod(long hours, long minutes) {
    SetPeriod(hours * 3600 + minutes * 60);
}

void Schedule::SetRepeatTimesInDay(long times) {
    repeat_times_in_day_ = static_cast<int>(times);
    if (times == 0) {
        period_ = 0;
    }
}

void Schedule::SetWeekSchedule(const std::string& text) {
    if (text.size() < kWeekDays) {
        week_schedule_ = kEveryDay;
        return;
    }
    week_schedule_.resize(kWeekDays);
    bool any = false;
    for (int i = 0; i < kWeekDays; ++i) {
        week_schedule_[i] = text[i] == '0' ? '0' : '1';
        any = any || week_schedule_[i] == '1';
    }
    // Choosing no day at all means every day, on purpose: a task is never left without days.
    if (!any) {
        week_schedule_ = kEveryDay;
    }
}

std::string Schedule::GetModeStr() const {
    switch (mode_) {
        case SCHD_MANUAL:
            return "manual";
        case SCHD_REALTIME:
            return "realtime";
        case SCHD_MONTHLY:
            return "monthly";
        case SCHD_YEARLY:
            return "yearly";
        case SCHD_ONCE:
            return "once";
        case SCHD_WEEKLY:
        default:
            return "weekly";
    }
}

void Schedule::SetModeByStr(const std::string& text) {
    if (text == "realtime") {
        mode_ = SCHD_REALTIME;
    } else if (text == "weekly") {
        mode_ = SCHD_WEEKLY;
    } else if (text == "monthly") {
        mode_ = SCHD_MONTHLY;
    } else if (text == "yearly") {
        mode_ = SCHD_YEARLY;
    } else if (text == "once") {
        mode_ = SCHD_ONCE;
    } else {
        mode_ = SCHD_MANUAL;
    }
}

struct tm Schedule::GetScheduleBegin() const {
    struct tm begin;
    std::memset(&begin, 0, sizeof(begin));
    begin.tm_year = begin_year_ - 1900;
    begin.tm_mon = begin_month_ - 1;
    begin.tm_mday = begin_day_;
    begin.tm_hour = start_hour_;
    begin.tm_min = start_minute_;
    begin.tm_sec = 0;
    begin.tm_isdst = 0;
    return begin;
}

bool Schedule::Validate() const {
    // Compared as unsigned so that negative values fail the upper bounds too.
    if (static_cast<unsigned>(start_hour_) > 23) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Invalid begin hour\n",
                       kLineBadHour);
        return false;
    }
    if (static_cast<unsigned>(start_minute_) > 59) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Invalid begin minute\n",
                       kLineBadMinute);
        return false;
    }
    // The two texts below each name the other's field; they are kept as they have always read.
    if (static_cast<unsigned>(period_) > kLastSecondOfDay) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Invalid period or repeat\n",
                       kLineBadPeriod);
        return false;
    }
    if (static_cast<unsigned>(repeat_times_in_day_) > kMaxRepeats) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Invalid period\n",
                       kLineBadRepeat);
        return false;
    }
    // The last run of a day must fall on that day.
    int start = start_hour_ * 3600 + start_minute_ * 60;
    if (static_cast<long>(start) + static_cast<long>(repeat_times_in_day_) * period_ >
        static_cast<long>(kLastSecondOfDay)) {
        Logger::LogMsg(Logger::Note,
                       "[NOTE] s2s_sync_obj.cpp(%d): Invalid repeat in day [%d + %d * %d]\n",
                       kLineRepeatPastDay, start, period_, repeat_times_in_day_);
        return false;
    }
    // Noon keeps the check clear of clock changes, which happen at night.
    struct tm begin = GetScheduleBegin();
    begin.tm_hour = 12;
    struct tm normalised = begin;
    if (mktime(&normalised) < 0) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Invalid begin\n", kLineBadBegin);
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): %d %d %d %d %d %d\n",
                       kLineBadBeginFields, normalised.tm_year, normalised.tm_mon,
                       normalised.tm_mday, normalised.tm_hour, normalised.tm_min,
                       normalised.tm_sec);
        return false;
    }
    if (!SameDate(normalised, begin)) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Invalid begin date\n",
                       kLineBadBeginDate);
        return false;
    }
    // The week schedule and the begin date are checked for every mode, also those not using them.
    if (week_schedule_.size() != kWeekDays) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Wrong length of weekday '%s'\n",
                       kLineWeekLength, week_schedule_.c_str());
        return false;
    }
    if (week_schedule_.find_first_not_of('0') == std::string::npos) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Invalid weekday '%s'\n",
                       kLineNoWeekdayChosen, week_schedule_.c_str());
        return false;
    }
    if (static_cast<unsigned>(mode_) > SCHD_ONCE) {
        Logger::LogMsg(Logger::Note, "[NOTE] s2s_sync_obj.cpp(%d): Invalid schedule mode [%d]\n",
                       kLineBadMode, static_cast<int>(mode_));
        return false;
    }
    return true;
}

namespace {

// How the day walk turns a broken-down local time into seconds.
enum class Clock {
    // mktime as it stands. The daylight-saving flag is the one the time got from the last mktime,
    // possibly of another day, and an aligned date that a common year lacks stays rolled over.
    kCompatible,
    // By the wall clock (ResolveLocal), the flag ignored; the next month or year is counted from
    // the aligned date as asked for.
    kWallClock,
};

time_t ToSeconds(struct tm& tm, Clock clock, bool keep_date) {
    return clock == Clock::kWallClock ? ResolveLocal(tm, keep_date) : mktime(&tm);
}

// The next run after `now`, walking local calendar days: align to the next day the mode allows,
// try that day's runs, else move on to the following day.
long NextRun(const Schedule& schedule, long now, Clock clock) {
    if (now < 0) {
        return -1;
    }
    struct tm now_tm;
    std::memset(&now_tm, 0, sizeof(now_tm));
    time_t now_time = static_cast<time_t>(now);
    // A time too large for a calendar year leaves zeroed fields, which fail further down. They
    // must be zeroed again: localtime_r fills in part of the overflowing date before it gives up,
    // and a walk starting from there never finds a run later than `now`.
    if (localtime_r(&now_time, &now_tm) == nullptr) {
        std::memset(&now_tm, 0, sizeof(now_tm));
    }

    const SCHD_MODE mode = schedule.GetMode();
    if (mode == SCHD_MANUAL) {
        return 0;
    }
    if (mode == SCHD_REALTIME) {
        return now + 1;
    }
    const std::string week = schedule.GetWeekSchedule();
    const int repeats = schedule.GetRepeatTimesInDay();
    const long period = schedule.GetPeriodSeconds();

    // Each pass either returns or moves now_tm on by one day. A valid schedule has a run on every
    // chosen weekday, every month or every year, so the walk is a few passes at most.
    for (;;) {
        const struct tm begin = schedule.GetScheduleBegin();
        // The current day at the current time of day, with its weekday.
        struct tm ref = now_tm;
        ToSeconds(ref, clock, true);

        switch (mode) {
            case SCHD_WEEKLY: {
                int days = GetDaysToNextSync(static_cast<unsigned>(ref.tm_wday), week);
                if (days < 0) {
                    Logger::LogMsg(Logger::Error,
                                   "[ERROR] s2s_sync_obj.cpp(%d): No chosen week day for sync "
                                   "'%s'\n",
                                   kLineNoWeekday, week.c_str());
                    Logger::LogMsg(Logger::Error,
                                   "[ERROR] s2s_sync_obj.cpp(%d): Fail to align to scheduled day\n",
                                   kLineAlignFailed);
                    return -1;
                }
                ref.tm_mday += days;
                break;
            }
            case SCHD_MONTHLY:
                ref.tm_mday = begin.tm_mday;
                break;
            case SCHD_YEARLY:
                ref.tm_mon = begin.tm_mon;
                ref.tm_mday = begin.tm_mday;
                break;
            case SCHD_ONCE:
                ref.tm_year = begin.tm_year;
                ref.tm_mon = begin.tm_mon;
                ref.tm_mday = begin.tm_mday;
                break;
            default:
                Logger::LogMsg(Logger::Error,
                               "[ERROR] s2s_sync_obj.cpp(%d): Unknown schedule mode [%d]\n",
                               kLineUnknownMode, static_cast<int>(mode));
                Logger::LogMsg(Logger::Error,
                               "[ERROR] s2s_sync_obj.cpp(%d): Fail to align to scheduled day\n",
                               kLineAlignFailed);
                return -1;
        }

        struct tm now_copy = now_tm;
        long now_secs = static_cast<long>(ToSeconds(now_copy, clock, true));
        if (now_secs < 0) {
            LogTimeFields(kLineReferenceSeconds, "reference", now_copy);
            return -1;
        }
        // Normalising rolls an overflowing day into the next month: a monthly task on the 31st
        // runs on the 1st after a 30-day month.
        const struct tm aligned = ref;
        long ref_secs = static_cast<long>(ToSeconds(ref, clock, true));

        // Both carry the same time of day, so this says the aligned day lies before today.
        if (now_secs > ref_secs) {
            if (ref_secs < 0) {
                LogTimeFields(kLinePastScheduled, "scheduled", ref);
                return -1;
            }
            // By the wall clock the next month or year is counted from the aligned date as asked
            // for: 29 February of a common year reads as 1 March, and one year on from there
            // would miss the leap year's 29 February. The compatible arithmetic counts from the
            // normalised date. The next mktime normalises the sum.
            if (clock == Clock::kWallClock && (mode == SCHD_MONTHLY || mode == SCHD_YEARLY)) {
                ref = aligned;
            }
            switch (mode) {
                case SCHD_MONTHLY:
                    ref.tm_mon += 1;
                    break;
                case SCHD_YEARLY:
                    ref.tm_year += 1;
                    break;
                case SCHD_ONCE:
                    return 0;  // the single run is past
                case SCHD_WEEKLY:
                    // The weekly alignment never goes back; kept as a guard.
                    Logger::LogMsg(Logger::Error,
                                   "[ERROR] s2s_sync_obj.cpp(%d): No chosen week day for sync\n",
                                   kLinePastWeekly);
                    return -1;
                default:
                    Logger::LogMsg(Logger::Error,
                                   "[ERROR] s2s_sync_obj.cpp(%d): Unsupported schedule mode "
                                   "[%d]\n",
                                   kLinePastUnsupported, static_cast<int>(mode));
                    return -1;
            }
        }

        // The day's first run at its start time. The compatible arithmetic keeps the flag `ref`
        // got from its last mktime.
        struct tm day = ref;
        day.tm_hour = schedule.GetStartHour();
        day.tm_min = schedule.GetStartMinute();
        day.tm_sec = 0;
        long first = static_cast<long>(ToSeconds(day, clock, false));
        if (first < 0) {
            // This day cannot be expressed; try the next one.
            LogTimeFields(kLineDaySeconds, "scheduled", day);
        } else if (repeats >= 0 && first > 0) {
            // Repeats are plain seconds apart, so after a clock change within the day they keep
            // their distance rather than their wall-clock times. The first one strictly after
            // `now` is the answer; with a period of 0 or less none after the first can be.
            if (first > now) {
                return first;
            }
            if (period > 0) {
                long k = (now - first) / period + 1;
                if (k <= repeats) {
                    return first + k * period;
                }
            }
        }

        // The next day, from its beginning.
        now_tm = ref;
        now_tm.tm_hour = 0;
        now_tm.tm_min = 0;
        now_tm.tm_sec = 0;
        now_tm.tm_mday += 1;
    }
}

}  // namespace

long Schedule::GetNextScheduledSeconds(long now) const {
    return NextRun(*this, now, Clock::kCompatible);
}

long Schedule::NextRunAfter(long now) const {
    return NextRun(*this, now, Clock::kWallClock);
}

}  // namespace S2S
