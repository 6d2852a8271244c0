// The scheduler against a clock the test moves: runs fall due at their time and once, missed runs
// run once at start, and a clock jump or a time-zone change recomputes the next runs.
#include "service/scheduler.h"

#include <gtest/gtest.h>
#include <time.h>

#include "support/test_util.h"

namespace {

class FakeClock : public s2sd::WallClock {
  public:
    long Now() const override { return wall; }
    long Monotonic() const override { return mono; }
    std::string Zone() const override { return zone; }
    void Advance(long seconds) { wall += seconds, mono += seconds; }  // time passes normally

    long wall = 0, mono = 1000;
    std::string zone = "UTC 0";
};

// Epoch seconds of a UTC wall-clock time (the tests run with TZ=UTC).
long At(int year, int month, int day, int hour, int minute) {
    struct tm tm = {0, minute, hour, day, month - 1, year - 1900, 0, 0, 0, 0, nullptr};
    return static_cast<long>(timegm(&tm));
}

S2S::Schedule DailyAt2() {
    S2S::Schedule schedule;
    schedule.SetMode(S2S::SCHD_MODE(2));
    schedule.SetWeekSchedule("1111111");
    schedule.SetStartHour(2);
    return schedule;
}

class SchedulerTest : public ::testing::Test {
  protected:
    SchedulerTest() : tz_("TZ", "UTC") { tzset(); }

    s2s_test::ScopedEnv tz_;
    FakeClock clock_;
};

TEST_F(SchedulerTest, RunsFallDueOnceAtTheirTimeAndRunsMissedWhileDownRunOnceAtStart) {
    clock_.wall = At(2024, 3, 4, 1, 0);
    s2sd::Scheduler scheduler(clock_);
    scheduler.Set(7, DailyAt2(), clock_.wall);
    scheduler.Set(8, S2S::Schedule(), clock_.wall);  // manual: never
    EXPECT_EQ(scheduler.NextRun(7), At(2024, 3, 4, 2, 0));
    EXPECT_EQ(scheduler.NextRun(8), 0);

    clock_.Advance(3599);
    EXPECT_TRUE(scheduler.Tick().empty());
    clock_.Advance(1);
    std::map<uint64_t, long> due_at;
    EXPECT_EQ(scheduler.Tick(&due_at), std::vector<uint64_t>{7});
    EXPECT_EQ(due_at[7], At(2024, 3, 4, 2, 0));
    EXPECT_TRUE(scheduler.Tick().empty());
    EXPECT_EQ(scheduler.NextRun(7), At(2024, 3, 5, 2, 0));

    // Last run on the 1st at 02:00; the service comes back on the 4th at 10:00.
    clock_.wall = At(2024, 3, 4, 10, 0);
    s2sd::Scheduler restarted(clock_);
    restarted.Set(7, DailyAt2(), At(2024, 3, 1, 2, 0));
    // Stored while the clock was three weeks ahead: counted from now, not from then.
    restarted.Set(9, DailyAt2(), At(2024, 3, 25, 2, 0));
    EXPECT_EQ(restarted.Tick(), std::vector<uint64_t>{7});
    EXPECT_TRUE(restarted.Tick().empty());
    EXPECT_EQ(restarted.NextRun(7), At(2024, 3, 5, 2, 0));
    EXPECT_EQ(restarted.NextRun(9), At(2024, 3, 5, 2, 0));
}

TEST_F(SchedulerTest, ClockJumpsAndZoneChangesRecomputeNextRuns) {
    clock_.wall = At(2024, 3, 10, 1, 0);
    s2sd::Scheduler scheduler(clock_);
    scheduler.Set(7, DailyAt2(), clock_.wall);

    // The clock is set back two days: the next run is tomorrow's, not one three days away.
    clock_.wall = At(2024, 3, 8, 12, 0);
    EXPECT_TRUE(scheduler.Tick().empty());
    EXPECT_TRUE(scheduler.Recomputed());
    EXPECT_EQ(scheduler.NextRun(7), At(2024, 3, 9, 2, 0));

    // Small steps are no jump.
    clock_.Advance(60);
    scheduler.Tick();
    EXPECT_FALSE(scheduler.Recomputed());

    // Forward past a run: it runs once, then the next is counted from now.
    clock_.wall = At(2024, 3, 9, 5, 0);
    EXPECT_EQ(scheduler.Tick(), std::vector<uint64_t>{7});
    EXPECT_EQ(scheduler.NextRun(7), At(2024, 3, 10, 2, 0));

    // A new time zone: 02:00 local is now 01:00 UTC.
    s2s_test::ScopedEnv zone("TZ", "XXX-1");
    tzset();
    clock_.zone = "XXX 3600";
    clock_.Advance(1);
    EXPECT_TRUE(scheduler.Tick().empty());
    EXPECT_TRUE(scheduler.Recomputed());
    EXPECT_EQ(scheduler.NextRun(7), At(2024, 3, 10, 1, 0));
}

}  // namespace
