// The sync model: the value classes that describe one sync task (where to copy, when, which shared
// folders) and the events it produces, the schedule's next-run arithmetic, the conversion of a
// task to and from the flat PObject map that front ends and the daemon exchange, and the
// human-readable dumps used in logs and on the command line.
//
// All classes are plain values (default copy). Validate() never throws and never alters the
// object: it logs one NOTE line naming the first broken rule and returns false.
#ifndef S2S_SYNC_OBJ_H
#define S2S_SYNC_OBJ_H

#include <ctime>
#include <list>
#include <ostream>
#include <string>

#include "s2s_export.h"
#include "s2s_pobject.h"

namespace S2S {

// When a task runs. Stored and sent as a signed 32-bit number; only 0 to 5 are valid, but values
// outside that range are kept as given (Schedule::Validate rejects them).
enum SCHD_MODE : int {
    SCHD_MANUAL = 0,
    SCHD_REALTIME = 1,
    SCHD_WEEKLY = 2,
    SCHD_MONTHLY = 3,
    SCHD_YEARLY = 4,
    SCHD_ONCE = 5,
};

// Opaque numbers assigned by the daemon (outside this library); the library only stores, prints
// and passes them on. Build one from a number with a cast: static_cast<TASK_STATUS>(2).
enum EVENT_STATUS : int {};
enum TASK_STATUS : int {};
enum TASK_RESULT : int {};

// A local shared folder.
class S2S_EXPORT Share {
  public:
    unsigned long long GetID() const { return id_; }
    void SetID(unsigned long long id) { id_ = id; }
    std::string GetName() const { return name_; }
    void SetName(const std::string& name) { name_ = name; }

  private:
    unsigned long long id_ = 0;
    std::string name_;
};

// A change to one file inside a share.
class S2S_EXPORT Event {
  public:
    unsigned long long GetID() const { return id_; }
    void SetID(unsigned long long id) { id_ = id; }
    EVENT_STATUS GetStatus() const { return status_; }
    void SetStatus(EVENT_STATUS status) { status_ = status; }
    std::string GetShareName() const { return share_name_; }
    void SetShareName(const std::string& name) { share_name_ = name; }
    std::string GetRelativePath() const { return relative_path_; }
    // Stores the path with a leading "/" (an empty path becomes "/"); nothing else is normalised.
    void SetRelativePath(const std::string& path);

  private:
    EVENT_STATUS status_ = EVENT_STATUS();
    unsigned long long id_ = 0;
    std::string share_name_;
    std::string relative_path_;
};

// How to reach the remote server. The password is kept in plain text; the dump never shows it.
class S2S_EXPORT SyncInfo {
  public:
    // Bits of the sync config flag; other bits are kept as given and ignored.
    enum : unsigned { kCompressionBit = 1u, kSSHBit = 2u, kBlockLevelBit = 4u };

    bool UseCompression() const { return (sync_config_flag_ & kCompressionBit) != 0; }
    bool UseSSH() const { return (sync_config_flag_ & kSSHBit) != 0; }
    bool UseBlockLevelSync() const { return (sync_config_flag_ & kBlockLevelBit) != 0; }
    void SetCompression(bool on) { SetBit(kCompressionBit, on); }
    void SetSSH(bool on) { SetBit(kSSHBit, on); }
    void SetBlockLevelSync(bool on) { SetBit(kBlockLevelBit, on); }
    unsigned GetSyncConfigFlag() const { return sync_config_flag_; }
    void SetSyncConfigFlag(unsigned flag) { sync_config_flag_ = flag; }

    unsigned GetSSHPort() const { return ssh_port_; }
    void SetSSHPort(unsigned port) { ssh_port_ = port; }
    unsigned GetMaxBandwidth() const { return max_bandwidth_; }
    void SetMaxBandwidth(unsigned bandwidth) { max_bandwidth_ = bandwidth; }

    std::string GetUser() const { return user_; }
    void SetUser(const std::string& user) { user_ = user; }
    std::string GetPassword() const { return password_; }
    void SetPassword(const std::string& password) { password_ = password; }
    std::string GetServerIP() const { return server_ip_; }
    void SetServerIP(const std::string& ip) { server_ip_ = ip; }
    std::string GetServerName() const { return server_name_; }
    void SetServerName(const std::string& name) { server_name_ = name; }

    // A server (IP or name), a user, and an SSH port of at most 65535 (0 means "not set").
    bool Validate() const;

  private:
    void SetBit(unsigned bit, bool on) {
        sync_config_flag_ = on ? (sync_config_flag_ | bit) : (sync_config_flag_ & ~bit);
    }

    unsigned sync_config_flag_ = 0;
    unsigned ssh_port_ = 0;
    unsigned max_bandwidth_ = 0;
    std::string user_;
    std::string password_;
    std::string server_ip_;
    std::string server_name_;
};

// When a task runs: never by itself (manual), continuously (realtime), on chosen weekdays, once a
// month, once a year or once, each time at start_hour:start_minute local time and then
// repeat_times_in_day more times, period seconds apart, on the same day. All calendar arithmetic
// uses the process's time zone (TZ).
class S2S_EXPORT Schedule {
  public:
    SCHD_MODE GetMode() const { return mode_; }
    int GetPeriodSeconds() const { return period_; }
    int GetRepeatTimesInDay() const { return repeat_times_in_day_; }
    int GetBeginYear() const { return begin_year_; }
    int GetBeginMonth() const { return begin_month_; }
    int GetBeginDay() const { return begin_day_; }
    int GetStartHour() const { return start_hour_; }
    int GetStartMinute() const { return start_minute_; }
    std::string GetWeekSchedule() const { return week_schedule_; }
    int GetPeriodHourPart() const { return period_ / 3600; }
    int GetPeriodMinutePart() const { return (period_ / 60) % 60; }

    void SetMode(SCHD_MODE mode) { mode_ = mode; }
    // The period and the repeat count are coupled: setting either to 0 clears the other.
    void SetPeriod(long seconds);
    void SetPeriod(long hours, long minutes);
    void SetRepeatTimesInDay(long times);
    void SetBeginYear(int year) { begin_year_ = year; }
    void SetBeginMonth(int month) { begin_month_ = month; }  // 1 to 12
    void SetBeginDay(int day) { begin_day_ = day; }
    void SetStartHour(int hour) { start_hour_ = hour; }
    void SetStartMinute(int minute) { start_minute_ = minute; }
    // Seven characters, one per weekday from Sunday: "0" is not chosen, anything else is. A text
    // shorter than 7 characters, or one choosing no day, means every day ("1111111").
    void SetWeekSchedule(const std::string& text);

    // "manual", "realtime", "weekly", "monthly", "yearly", "once"; an invalid mode reads "weekly".
    std::string GetModeStr() const;
    // Exact, case-sensitive; any other text (also "manual") sets manual.
    void SetModeByStr(const std::string& text);

    // The begin date at the start time, seconds 0, daylight-saving flag 0.
    struct tm GetScheduleBegin() const;

    bool Validate() const;

    // The compatible arithmetic, as front ends compute it: near clock changes a run may be off by
    // the change or a day, and yearly 29 February can slip to 1 March. Ours use NextRunAfter.
    long GetNextScheduledSeconds(long now) const;

    // Seconds since the epoch of the first run strictly after `now`, by the local wall clock; 0
    // when there is no next run (manual, or a "once" task whose run is past); -1 on error (logged,
    // with the same lines as GetNextScheduledSeconds). Realtime gives now + 1.
    // Run days: weekly on the chosen weekdays; monthly on begin_day of the current month and on,
    // a day the month lacks rolling over into the next (the 31st after April is 1 May); yearly on
    // begin month and day of the current year and on; once on the begin date. A day's first run
    // is at its start time on the local clock; repeats follow in plain seconds.
    // How it differs from GetNextScheduledSeconds (everything else is the same):
    //   situation                          GetNextScheduledSeconds        NextRunAfter
    //   a day after a clock change,        the flag of the day it was     the start time on
    //   computed on a day before it        computed on is kept: the run   the local clock
    //                                      is off by the change (1 h,
    //                                      30 min) or on the day next to
    //                                      it when aligned late at night
    //   start inside the repeated hour,    runs again at the second       runs once, at the
    //   asked after its first occurrence   occurrence                     first occurrence
    //   start inside the skipped hour      moved on by the change         the first instant
    //                                      (02:30 runs at 03:30)          after it: the jump
    //   yearly on 29 February, the year    1 March of the leap year       29 February
    //   after a common year
    // REQUIRES (both): a schedule that passes Validate(). The search walks day by day without a
    // limit, so an invalid one (a negative repeat count, for example) may never find a run.
    long NextRunAfter(long now) const;

  private:
    SCHD_MODE mode_ = SCHD_MANUAL;
    int period_ = 0;
    int repeat_times_in_day_ = 0;
    std::string week_schedule_ = "1111111";
    int begin_year_ = 2014;
    int begin_month_ = 1;
    int begin_day_ = 1;
    int start_hour_ = 0;
    int start_minute_ = 0;
};

// Days from `weekday` (0 = Sunday) to the next weekday chosen in `week_schedule` ("1"), today
// counting as 0; -1 when none is chosen.
S2S_EXPORT int GetDaysToNextSync(unsigned weekday, std::string week_schedule);

// One task's definition.
class S2S_EXPORT TaskInfo {
  public:
    TaskInfo() = default;
    TaskInfo(const TaskInfo&) = default;
    TaskInfo(TaskInfo&&) = default;
    TaskInfo& operator=(const TaskInfo&) = default;
    TaskInfo& operator=(TaskInfo&&) = default;
    ~TaskInfo();

    std::string GetName() const { return name_; }
    void SetName(const std::string& name) { name_ = name; }
    const std::list<std::string>& GetShareList() const { return share_list_; }
    void SetShareList(const std::list<std::string>& shares) { share_list_ = shares; }
    const SyncInfo& GetSyncInfo() const { return sync_info_; }
    void SetSyncInfo(const SyncInfo& info) { sync_info_ = info; }
    const Schedule& GetSchedule() const { return schedule_; }
    Schedule& GetSchedule() { return schedule_; }
    void SetSchedule(const Schedule& schedule) { schedule_ = schedule; }

    // The server info, the schedule, a name, a non-empty share list, and every share valid on
    // this machine (asked of IsValidShare, in list order).
    bool Validate() const;

  private:
    std::string name_;
    std::list<std::string> share_list_;
    SyncInfo sync_info_;
    Schedule schedule_;
};

// A stored task: its identity and its definition.
class S2S_EXPORT SyncTask {
  public:
    unsigned long long GetID() const { return id_; }
    void SetID(unsigned long long id) { id_ = id; }
    const TaskInfo& GetInfo() const { return info_; }
    TaskInfo& GetInfo() { return info_; }
    void SetInfo(const TaskInfo& info);

  private:
    unsigned long long id_ = 0;
    TaskInfo info_;
};

// Conversion to and from the flat task map ("id", "name", "share_list", "user", "pswd",
// "server_ip", "server_name", "compress", "block", "ssh", "ssh_port", "max_bandwidth",
// "schedule_mode", "schedule_begin_year", "schedule_begin_month", "schedule_begin_day",
// "schedule_begin_hour", "schedule_begin_min", "week_schd", "period_hour", "period_minute",
// "repeat_times_in_day"). Writing never clears the target (a caller's own keys stay); the period
// travels in whole minutes and only the three known flag bits travel. Nothing fails or logs.
S2S_EXPORT void TaskInfo2PObj(const TaskInfo& info, PObject& obj);
S2S_EXPORT void SyncTask2PObj(const SyncTask& task, PObject& obj);
// Only the keys present are read; the others leave `info` as it was.
S2S_EXPORT void PObj2SyncInfo(const PObject& obj, SyncInfo& info);
// Replaces the task's info as a whole (missing keys take the defaults); the id only if "id" is
// present. Nothing is validated.
S2S_EXPORT void PObj2SyncTask(const PObject& obj, SyncTask& task);
// The same, then "status" and "sync_result" (0 when missing).
S2S_EXPORT void PObj2SyncTask(const PObject& obj, SyncTask& task, TASK_STATUS& status,
                              TASK_RESULT& result);

// Fixed human-readable dumps, one dotted label per line. The Schedule dump (and so the TaskInfo
// and SyncTask dumps) ends without a newline and leaves '0' as the stream's fill character.
S2S_EXPORT std::ostream& operator<<(std::ostream& os, const Share& share);
S2S_EXPORT std::ostream& operator<<(std::ostream& os, const Event& event);
S2S_EXPORT std::ostream& operator<<(std::ostream& os, const SyncInfo& info);
S2S_EXPORT std::ostream& operator<<(std::ostream& os, const Schedule& schedule);
S2S_EXPORT std::ostream& operator<<(std::ostream& os, const TaskInfo& info);
S2S_EXPORT std::ostream& operator<<(std::ostream& os, const SyncTask& task);

}  // namespace S2S

#endif  // S2S_SYNC_OBJ_H
