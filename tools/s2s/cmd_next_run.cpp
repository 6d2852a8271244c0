// s2s next-run: when a task runs next, by the local wall clock (or, with --compatible, by the
// arithmetic other front ends share), printed in local time.
#include <ctime>
#include <nlohmann/json.hpp>

#include "s2s_sync_obj.h"
#include "tools/s2s/commands.h"
#include "tools/s2s/exit_codes.h"
#include "tools/s2s/options.h"
#include "tools/s2s/progress.h"
#include "tools/s2s/service_view.h"
#include "tools/s2s/task_file.h"

namespace s2s_cli {

namespace {

const std::vector<OptionSpec> kNextRunOptions = {
    {"task", "FILE", false, "read the schedule from a task file"},
    {"mode", "MODE", false, "manual, realtime, weekly, monthly, yearly or once (default weekly)"},
    {"at", "HH:MM", false, "the first run of a scheduled day (default 00:00)"},
    {"days", "DAYS", false, "weekly: 7 digits from Sunday (0111110) or names (mon,wed,fri)"},
    {"begin", "YYYY-MM-DD", false, "the begin date (the day for once, monthly and yearly)"},
    {"every", "HH:MM", false, "repeat within the day at this interval"},
    {"repeat", "N", false, "the number of repeats after the first run of a day (0 to 95)"},
    {"now", "TIME", false, "compute from this time: YYYY-MM-DD HH:MM[:SS] (local) or @SECONDS"},
    {"count", "N", false, "print the next N runs (1 to 1000, default 1)"},
    {"compatible", "", false,
     "use the arithmetic other front ends show (differs near clock changes)"},
    {"json", "", false, "print the result as JSON"},
    {"help", "", false, "show this help"},
};

const char kNextRunEpilogue[] =
    "Either --task or the schedule options. Times are printed in the local time zone (TZ).";

bool ParseClock(const std::string& text, int& hour, int& minute) {
    unsigned long long h = 0;
    unsigned long long m = 0;
    const size_t colon = text.find(':');
    if (colon == std::string::npos || !ParseUnsigned(text.substr(0, colon), 23, h) ||
        text.size() - colon - 1 != 2 || !ParseUnsigned(text.substr(colon + 1), 59, m)) {
        return false;
    }
    hour = static_cast<int>(h);
    minute = static_cast<int>(m);
    return true;
}

bool ParseDays(const std::string& text, std::string& week) {
    if (text.size() == 7 && text.find_first_not_of("01") == std::string::npos) {
        week = text;
        return text != "0000000";
    }
    static const char* const kNames[] = {"sun", "mon", "tue", "wed", "thu", "fri", "sat"};
    week = "0000000";
    size_t start = 0;
    while (start <= text.size()) {
        const size_t comma = text.find(',', start);
        const std::string name =
            text.substr(start, comma == std::string::npos ? std::string::npos : comma - start);
        bool known = false;
        for (int i = 0; i < 7; ++i) {
            if (name == kNames[i]) {
                week[i] = '1';
                known = true;
            }
        }
        if (!known) {
            return false;
        }
        if (comma == std::string::npos) {
            break;
        }
        start = comma + 1;
    }
    return true;
}

bool ParseDate(const std::string& text, int& year, int& month, int& day) {
    unsigned long long y = 0;
    unsigned long long m = 0;
    unsigned long long d = 0;
    if (text.size() != 10 || text[4] != '-' || text[7] != '-' ||
        !ParseUnsigned(text.substr(0, 4), 9999, y) || !ParseUnsigned(text.substr(5, 2), 12, m) ||
        !ParseUnsigned(text.substr(8, 2), 31, d) || y < 1970 || m < 1 || d < 1) {
        return false;
    }
    year = static_cast<int>(y);
    month = static_cast<int>(m);
    day = static_cast<int>(d);
    return true;
}

// `skipped` tells a well-formed local time that does not exist in the local time zone.
bool ParseNow(const std::string& text, long& now, bool& skipped) {
    skipped = false;
    unsigned long long seconds = 0;
    if (!text.empty() && text[0] == '@') {
        if (!ParseUnsigned(text.substr(1), 253402300799ULL, seconds)) {
            return false;
        }
        now = static_cast<long>(seconds);
        return true;
    }
    int year = 0;
    int month = 0;
    int day = 0;
    int hour = 0;
    int minute = 0;
    unsigned long long second = 0;
    if (text.size() < 16 || text[10] != ' ' || !ParseDate(text.substr(0, 10), year, month, day) ||
        !ParseClock(text.substr(11, 5), hour, minute)) {
        return false;
    }
    if (text.size() > 16 &&
        (text.size() != 19 || text[16] != ':' || !ParseUnsigned(text.substr(17), 59, second))) {
        return false;
    }
    struct tm tm = {};
    tm.tm_year = year - 1900;
    tm.tm_mon = month - 1;
    tm.tm_mday = day;
    tm.tm_hour = hour;
    tm.tm_min = minute;
    tm.tm_sec = static_cast<int>(second);
    const struct tm asked = tm;
    tm.tm_isdst = -1;
    time_t t = mktime(&tm);
    if (t < 0 || tm.tm_mday != day) {
        return false;
    }
    // A time the clocks skip (the hour lost when they go forward) comes back moved by mktime.
    if (tm.tm_hour != hour || tm.tm_min != minute) {
        skipped = true;
        return false;
    }
    // A time the clocks repeat is its first occurrence, in daylight-saving time.
    struct tm summer = asked;
    summer.tm_isdst = 1;
    const time_t first = mktime(&summer);
    if (first >= 0 && first < t && summer.tm_mday == day && summer.tm_hour == hour &&
        summer.tm_min == minute) {
        t = first;
    }
    now = static_cast<long>(t);
    return true;
}

std::string LocalTime(long seconds) {
    return LocalTimeText(seconds, "%a %Y-%m-%d %H:%M:%S %Z");
}

// Builds the schedule from the options; false with `error` on a value that does not parse.
bool ScheduleFromOptions(const Options& opts, S2S::Schedule& schedule, std::string& error) {
    const std::string mode = opts.Get("mode", "weekly");
    static const char* const kModes[] = {"manual",  "realtime", "weekly",
                                         "monthly", "yearly",   "once"};
    bool known = false;
    for (int i = 0; i < 6; ++i) {
        if (mode == kModes[i]) {
            schedule.SetMode(static_cast<S2S::SCHD_MODE>(i));
            known = true;
        }
    }
    if (!known) {
        error =
            "--mode '" + mode + "' is not one of manual, realtime, weekly, monthly, yearly, once";
        return false;
    }
    int hour = 0;
    int minute = 0;
    if (opts.Has("at")) {
        if (!ParseClock(opts.Get("at"), hour, minute)) {
            error = "--at '" + opts.Get("at") + "' is not a time HH:MM";
            return false;
        }
        schedule.SetStartHour(hour);
        schedule.SetStartMinute(minute);
    }
    if (opts.Has("days")) {
        std::string week;
        if (!ParseDays(opts.Get("days"), week)) {
            error = "--days '" + opts.Get("days") +
                    "' is neither 7 digits 0/1 from Sunday nor a list like mon,wed,fri";
            return false;
        }
        schedule.SetWeekSchedule(week);
    }
    if (opts.Has("begin")) {
        int year = 0;
        int month = 0;
        int day = 0;
        if (!ParseDate(opts.Get("begin"), year, month, day)) {
            error = "--begin '" + opts.Get("begin") + "' is not a date YYYY-MM-DD";
            return false;
        }
        schedule.SetBeginYear(year);
        schedule.SetBeginMonth(month);
        schedule.SetBeginDay(day);
    }
    if (opts.Has("every") != opts.Has("repeat")) {
        error = "--every and --repeat go together";
        return false;
    }
    if (opts.Has("every")) {
        if (!ParseClock(opts.Get("every"), hour, minute)) {
            error = "--every '" + opts.Get("every") + "' is not an interval HH:MM";
            return false;
        }
        unsigned long long repeat = 0;
        if (!opts.GetUnsigned("repeat", 95, repeat, error)) {
            return false;
        }
        schedule.SetPeriod(hour, minute);
        schedule.SetRepeatTimesInDay(static_cast<long>(repeat));
    }
    return true;
}

// The next `count` runs after `now` by `next`; fewer when the schedule has no further run, one for
// realtime. False when the computation fails.
bool NextRuns(const S2S::Schedule& schedule, long (S2S::Schedule::*next)(long) const, long now,
              unsigned long long count, std::vector<long>& runs) {
    for (long from = now; runs.size() < count; from = runs.back()) {
        const long run = (schedule.*next)(from);
        if (run <= 0) {
            return run == 0;
        }
        runs.push_back(run);
        if (schedule.GetMode() == S2S::SCHD_REALTIME) {
            break;
        }
    }
    return true;
}

}  // namespace

int RunNextRunCommand(const Options& opts) {
    SetupLogging(0);
    std::string error;
    if (!opts.Positional().empty()) {
        return Fail(kExitUsage,
                    "next-run takes no arguments (unexpected '" + opts.Positional()[0] + "')");
    }
    S2S::Schedule schedule;
    std::string task_name;
    if (opts.Has("task")) {
        for (const char* option : {"mode", "at", "days", "begin", "every", "repeat"}) {
            if (opts.Has(option)) {
                return Fail(kExitUsage, std::string("--") + option + " cannot be used with --task");
            }
        }
        S2S::SyncTask task;
        bool has_password = false;
        if (!LoadTask(opts.Get("task"), task, has_password, error)) {
            return Fail(kExitInvalidTask, error);
        }
        schedule = task.GetInfo().GetSchedule();
        task_name = task.GetInfo().GetName();
    } else if (!ScheduleFromOptions(opts, schedule, error)) {
        return Fail(kExitUsage, error);
    }
    long now = static_cast<long>(time(nullptr));
    bool skipped = false;
    if (opts.Has("now") && !ParseNow(opts.Get("now"), now, skipped)) {
        return Fail(kExitUsage,
                    "--now '" + opts.Get("now") +
                        (skipped ? "' does not exist in the local time zone (the clocks skip it "
                                   "when they go forward); give a time outside the skipped hour or "
                                   "@SECONDS"
                                 : "' is neither YYYY-MM-DD HH:MM[:SS] nor @SECONDS"));
    }
    unsigned long long count = 1;
    if (opts.Has("count") && (!opts.GetUnsigned("count", 1000, count, error) || count == 0)) {
        return Fail(kExitUsage, "--count must be a number from 1 to 1000");
    }
    // The NOTE line naming the broken rule is the explanation a person needs here.
    SetupLogging(1);
    const bool valid = schedule.Validate();
    SetupLogging(0);
    if (!valid) {
        return Fail(kExitInvalidTask, "the schedule is invalid (see the note above)");
    }

    const bool compatible = opts.Has("compatible");
    std::vector<long> times;
    if (!NextRuns(
            schedule,
            compatible ? &S2S::Schedule::GetNextScheduledSeconds : &S2S::Schedule::NextRunAfter,
            now, count, times)) {
        return Fail(kExitInternal, "the next run cannot be computed (see the error above)");
    }
    // Where the compatible arithmetic disagrees on the runs shown, say so: other front ends show
    // its times. Its own failures are not this answer's: they stay out of the output.
    std::vector<long> other;
    SetupLogging(-1);
    const bool differs =
        !compatible &&
        NextRuns(schedule, &S2S::Schedule::GetNextScheduledSeconds, now, count, other) &&
        other != times;
    SetupLogging(0);
    nlohmann::json runs = nlohmann::json::array();
    for (const long next : times) {
        runs.push_back({{"time", LocalTime(next)}, {"epoch", next}, {"in_seconds", next - now}});
    }
    const S2S::SCHD_MODE mode = schedule.GetMode();
    const std::string state = mode == S2S::SCHD_MANUAL     ? "manual"
                              : mode == S2S::SCHD_REALTIME ? "realtime"
                              : times.empty()              ? "past"
                                                           : "scheduled";

    if (opts.Has("json")) {
        nlohmann::json doc = {{"mode", schedule.GetModeStr()},
                              {"now", LocalTime(now)},
                              {"state", state},
                              {"runs", runs}};
        if (!task_name.empty()) {
            doc["task"] = task_name;
        }
        if (!compatible) {
            doc["compatible_differs"] = differs;
        }
        std::printf("%s\n", doc.dump(2).c_str());
        return kExitOK;
    }
    const std::string prefix = task_name.empty() ? "" : "task \"" + task_name + "\": ";
    if (state == "manual") {
        std::printf("%snever by itself (manual schedule: runs only when started)\n",
                    prefix.c_str());
    } else if (state == "past") {
        std::printf("%sno further run (the single run of this schedule is past)\n", prefix.c_str());
    } else if (state == "realtime") {
        std::printf("%scontinuously (realtime: runs as soon as something changes)\n",
                    prefix.c_str());
    } else {
        for (const auto& run : runs) {
            std::printf("%s%s (in %s)\n", prefix.c_str(), run["time"].get<std::string>().c_str(),
                        FormatDuration(static_cast<double>(run["in_seconds"].get<long>())).c_str());
        }
    }
    if (differs) {
        size_t i = 0;
        while (i < times.size() && i < other.size() && times[i] == other[i]) {
            ++i;
        }
        std::printf("note: other front ends (--compatible) show %s instead of %s\n",
                    i < other.size() ? LocalTime(other[i]).c_str() : "no run",
                    i < times.size() ? LocalTime(times[i]).c_str() : "no run");
    }
    return kExitOK;
}

Command NextRunCommand() {
    return {"next-run",
            "s2s next-run (--task FILE | [--mode MODE] [--at HH:MM] ...)",
            "Prints when a task runs next, in local time.",
            kNextRunOptions,
            kNextRunEpilogue,
            RunNextRunCommand};
}

}  // namespace s2s_cli
