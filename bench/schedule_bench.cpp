// Cost of Schedule::NextRunAfter and of the compatible GetNextScheduledSeconds, and their worst
// cases.
//
// The next run is found by a day-by-day walk without an iteration limit. For a valid schedule the
// walk is short: today, then the next allowed day, month or year. The cases below are the longest
// walks that can be built (a yearly 29 February asked right after the common-year run on 1 March,
// a once-a-week task asked at its own run time, a 31st-of-the-month task asked at a month end,
// the last of 96 runs in a day), plus runs asked on a clock-change day, where NextRunAfter reads
// each wall-clock time both ways. BM_WorstFound searches a year of hourly moments over those
// schedules in the chosen zone, times every call, and then measures the slowest pair it found.
#include <benchmark/benchmark.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <string>
#include <vector>

#include "s2s_sync_obj.h"

namespace {

using S2S::Schedule;
using NextFn = long (Schedule::*)(long) const;

struct Function {
    const char* name;
    NextFn next;
};

const Function kFunctions[] = {{"NextRunAfter", &Schedule::NextRunAfter},
                               {"GetNextScheduledSeconds", &Schedule::GetNextScheduledSeconds}};

void UseZone(const char* zone) {
    setenv("TZ", zone, 1);
    tzset();
}

// Seconds since the epoch of a UTC wall-clock time.
long Utc(int y, int m, int d, int hour, int minute) {
    struct tm t {};
    t.tm_year = y - 1900;
    t.tm_mon = m - 1;
    t.tm_mday = d;
    t.tm_hour = hour;
    t.tm_min = minute;
    return static_cast<long>(timegm(&t));
}

Schedule Make(S2S::SCHD_MODE mode, int month, int day, int hour, int minute, long period = 0,
              long repeat = 0, const char* week = "1111111") {
    Schedule s;
    s.SetMode(mode);
    s.SetBeginYear(2024);
    s.SetBeginMonth(month);
    s.SetBeginDay(day);
    s.SetStartHour(hour);
    s.SetStartMinute(minute);
    s.SetPeriod(period);
    s.SetRepeatTimesInDay(repeat);
    s.SetWeekSchedule(week);
    return s;
}

struct Case {
    const char* name;
    Schedule schedule;
    long now;
};

// The moments are given in UTC; they are the named situation in Europe/Berlin (one hour ahead in
// winter) and close to it elsewhere.
std::vector<Case> Cases() {
    return {
        {"yearly_feb29_after_common_year_run", Make(S2S::SCHD_YEARLY, 2, 29, 6, 0),
         Utc(2027, 3, 1, 5, 0)},
        {"weekly_one_day_at_its_run", Make(S2S::SCHD_WEEKLY, 1, 1, 9, 0, 0, 0, "0000010"),
         Utc(2024, 1, 5, 8, 0)},
        {"monthly_31st_at_month_end_run", Make(S2S::SCHD_MONTHLY, 1, 31, 23, 59),
         Utc(2023, 1, 31, 22, 59)},
        {"daily_last_of_96_runs", Make(S2S::SCHD_WEEKLY, 1, 1, 0, 0, 900, 95),
         Utc(2024, 1, 15, 22, 45)},
        {"once_long_past", Make(S2S::SCHD_ONCE, 1, 1, 0, 0), Utc(2024, 6, 1, 0, 0)},
        {"daily_on_a_clock_change_day", Make(S2S::SCHD_WEEKLY, 1, 1, 2, 30, 1800, 3),
         Utc(2024, 3, 31, 0, 30)},
        {"weekly_from_the_evening_before_a_change",
         Make(S2S::SCHD_WEEKLY, 1, 1, 9, 0, 0, 0, "0100000"), Utc(2024, 3, 30, 22, 30)},
    };
}

void BM_NextRun(benchmark::State& state, NextFn next, const char* zone, size_t index) {
    UseZone(zone);
    const Case c = Cases()[index];
    long result = 0;
    for (auto _ : state) {
        result = (c.schedule.*next)(c.now);
        benchmark::DoNotOptimize(result);
    }
    if (result < 0) {
        state.SkipWithError("the computation failed");
    }
    state.SetLabel(c.name);
}

void BM_WorstFound(benchmark::State& state, NextFn next, const char* zone) {
    UseZone(zone);
    const std::vector<Case> cases = Cases();
    // Every hour of 2024 (and the minute before each), over every schedule above.
    double worst_ns = 0;
    size_t worst_case = 0;
    long worst_now = 0;
    const long from = Utc(2024, 1, 1, 0, 0);
    for (size_t i = 0; i < cases.size(); ++i) {
        for (long now = from; now < from + 366L * 86400; now += 3600) {
            for (long at : {now - 60, now}) {
                // The fastest of three, so that a preempted call does not pass for a slow case.
                double ns = 1e18;
                for (int repeat = 0; repeat < 3; ++repeat) {
                    auto t0 = std::chrono::steady_clock::now();
                    long r = (cases[i].schedule.*next)(at);
                    auto t1 = std::chrono::steady_clock::now();
                    benchmark::DoNotOptimize(r);
                    double took = std::chrono::duration<double, std::nano>(t1 - t0).count();
                    ns = took < ns ? took : ns;
                }
                if (ns > worst_ns) {
                    worst_ns = ns;
                    worst_case = i;
                    worst_now = at;
                }
            }
        }
    }
    const Schedule& s = cases[worst_case].schedule;
    for (auto _ : state) {
        benchmark::DoNotOptimize((s.*next)(worst_now));
    }
    state.SetLabel(std::string(cases[worst_case].name) + " at " + std::to_string(worst_now));
}

}  // namespace

int main(int argc, char** argv) {
    const char* zones[] = {"UTC", "Europe/Berlin", "Australia/Lord_Howe"};
    const size_t count = Cases().size();
    for (const Function& f : kFunctions) {
        const NextFn next = f.next;
        for (const char* zone : zones) {
            const std::string prefix = std::string("/") + f.name + "/" + zone;
            for (size_t i = 0; i < count; ++i) {
                benchmark::RegisterBenchmark(
                    ("BM_NextRun" + prefix + "/" + Cases()[i].name).c_str(),
                    [next, zone, i](benchmark::State& state) { BM_NextRun(state, next, zone, i); });
            }
            benchmark::RegisterBenchmark(
                ("BM_WorstFound" + prefix).c_str(),
                [next, zone](benchmark::State& state) { BM_WorstFound(state, next, zone); });
        }
    }
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
        return 1;
    }
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
