// Human-readable dumps of the sync objects for logs and the command line. Nothing parses them
// back, but people and scripts read them: labels, dot padding (the uneven "week_schd" label
// included), line order, the missing line end after a schedule and the '0' fill left on the
// stream are kept exactly. The password never appears.
#include <iomanip>
#include <ostream>

#include "s2s_sync_obj.h"

namespace S2S {

namespace {

const char* YesNo(bool value) {
    return value ? "yes" : "no";
}

}  // namespace

std::ostream& operator<<(std::ostream& os, const Share& share) {
    os << "id: ... " << share.GetID() << std::endl;
    os << "name: . " << share.GetName() << std::endl;
    return os;
}

std::ostream& operator<<(std::ostream& os, const Event& event) {
    os << "id: ............ " << event.GetID() << std::endl;
    os << "share_name: .... " << event.GetShareName() << std::endl;
    os << "relative_path: . " << event.GetRelativePath() << std::endl;
    os << "status: ........ " << static_cast<int>(event.GetStatus()) << std::endl;
    return os;
}

std::ostream& operator<<(std::ostream& os, const SyncInfo& info) {
    os << "user: ................. " << info.GetUser() << std::endl;
    os << "server_ip: ............ " << info.GetServerIP() << std::endl;
    os << "server_name: .......... " << info.GetServerName() << std::endl;
    os << "use compression: ...... " << YesNo(info.UseCompression()) << std::endl;
    os << "use block level sync: . " << YesNo(info.UseBlockLevelSync()) << std::endl;
    os << "use ssh: .............. " << YesNo(info.UseSSH()) << std::endl;
    os << "ssh port: ............. " << info.GetSSHPort() << std::endl;
    os << "max bandwidth: ........ " << info.GetMaxBandwidth() << std::endl;
    return os;
}

std::ostream& operator<<(std::ostream& os, const Schedule& schedule) {
    const struct tm begin = schedule.GetScheduleBegin();
    const long long period = schedule.GetPeriodSeconds();
    const long long last_run = static_cast<long long>(schedule.GetStartHour()) * 3600 +
                               static_cast<long long>(schedule.GetStartMinute()) * 60 +
                               static_cast<long long>(schedule.GetRepeatTimesInDay()) * period;

    os << "mode: ................ " << schedule.GetModeStr() << std::endl;
    os << "week_schd: ............. " << schedule.GetWeekSchedule() << std::endl;
    // The fill stays '0' after the dump: callers have always got it that way.
    os << std::setfill('0');
    os << "schedule_begin: ...... " << schedule.GetBeginYear() << "-" << std::setw(2)
       << begin.tm_mon + 1 << "-" << std::setw(2) << begin.tm_mday << " " << std::setw(2)
       << begin.tm_hour << ":" << std::setw(2) << begin.tm_min << ":" << std::setw(2)
       << begin.tm_sec << std::endl;
    os << "period: .............. " << std::setw(2) << period / 3600 << ":" << std::setw(2)
       << (period % 3600) / 60 << std::endl;
    os << "repeat_times_in_day: . " << schedule.GetRepeatTimesInDay() << std::endl;
    // No line end after the last line.
    os << "last sync in day: .... " << std::setw(2) << last_run / 3600 << ":" << std::setw(2)
       << (last_run % 3600) / 60;
    return os;
}

std::ostream& operator<<(std::ostream& os, const TaskInfo& info) {
    os << "name: ................. " << info.GetName() << std::endl;
    os << "share_list: ........... ";
    for (const std::string& share : info.GetShareList()) {
        os << share << ",";
    }
    os << std::endl;
    os << "<Server Info>" << std::endl;
    os << info.GetSyncInfo();
    os << "<Schedule>" << std::endl;
    os << info.GetSchedule();
    return os;
}

std::ostream& operator<<(std::ostream& os, const SyncTask& task) {
    os << "id: ................... " << task.GetID() << std::endl << std::endl;
    os << task.GetInfo();
    return os;
}

}  // namespace S2S
