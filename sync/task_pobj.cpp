// A task as the flat PObject map that front ends and the daemon exchange. This file owns the key
// names. The map is flat on purpose (no nested maps), and the period travels as whole hours and
// minutes, so seconds below a minute are dropped on the way.
#include "s2s_pobject.h"
#include "s2s_sync_obj.h"

namespace S2S {

namespace {

const char kKeyId[] = "id";
const char kKeyName[] = "name";
const char kKeyShareList[] = "share_list";
const char kKeyUser[] = "user";
const char kKeyPassword[] = "pswd";
const char kKeyServerIP[] = "server_ip";
const char kKeyServerName[] = "server_name";
const char kKeyCompress[] = "compress";
const char kKeyBlock[] = "block";
const char kKeySSH[] = "ssh";
const char kKeySSHPort[] = "ssh_port";
const char kKeyMaxBandwidth[] = "max_bandwidth";
const char kKeyMode[] = "schedule_mode";
const char kKeyBeginYear[] = "schedule_begin_year";
const char kKeyBeginMonth[] = "schedule_begin_month";
const char kKeyBeginDay[] = "schedule_begin_day";
const char kKeyBeginHour[] = "schedule_begin_hour";
const char kKeyBeginMinute[] = "schedule_begin_min";
const char kKeyWeekSchedule[] = "week_schd";
const char kKeyPeriodHour[] = "period_hour";
const char kKeyPeriodMinute[] = "period_minute";
const char kKeyRepeat[] = "repeat_times_in_day";
const char kKeyStatus[] = "status";
const char kKeySyncResult[] = "sync_result";

}  // namespace

void TaskInfo2PObj(const TaskInfo& info, PObject& obj) {
    const SyncInfo sync_info = info.GetSyncInfo();
    const Schedule schedule = info.GetSchedule();
    const std::list<std::string> shares = info.GetShareList();

    obj[kKeyName] = info.GetName();
    PObject::Array share_array;
    share_array.reserve(shares.size());
    for (const std::string& share : shares) {
        share_array.emplace_back(share);
    }
    obj[kKeyShareList] = share_array;
    obj[kKeyUser] = sync_info.GetUser();
    obj[kKeyPassword] = sync_info.GetPassword();
    obj[kKeyServerIP] = sync_info.GetServerIP();
    obj[kKeyServerName] = sync_info.GetServerName();
    obj[kKeyCompress] = sync_info.UseCompression();
    obj[kKeyBlock] = sync_info.UseBlockLevelSync();
    obj[kKeySSH] = sync_info.UseSSH();
    obj[kKeySSHPort] = sync_info.GetSSHPort();
    obj[kKeyMaxBandwidth] = sync_info.GetMaxBandwidth();
    // Signed values are sign-extended into the 64-bit integer; readers take the low 32 bits back.
    obj[kKeyMode] = static_cast<int>(schedule.GetMode());
    obj[kKeyBeginYear] = schedule.GetBeginYear();
    obj[kKeyBeginMonth] = schedule.GetBeginMonth();
    obj[kKeyBeginDay] = schedule.GetBeginDay();
    obj[kKeyBeginHour] = schedule.GetStartHour();
    obj[kKeyBeginMinute] = schedule.GetStartMinute();
    obj[kKeyWeekSchedule] = schedule.GetWeekSchedule();
    obj[kKeyPeriodHour] = schedule.GetPeriodHourPart();
    obj[kKeyPeriodMinute] = schedule.GetPeriodMinutePart();
    obj[kKeyRepeat] = schedule.GetRepeatTimesInDay();
}

void SyncTask2PObj(const SyncTask& task, PObject& obj) {
    obj[kKeyId] = task.GetID();
    TaskInfo2PObj(task.GetInfo(), obj);
}

void PObj2SyncInfo(const PObject& obj, SyncInfo& info) {
    if (obj.hasMember(kKeyUser)) {
        info.SetUser(obj[kKeyUser].asString());
    }
    if (obj.hasMember(kKeyPassword)) {
        info.SetPassword(obj[kKeyPassword].asString());
    }
    if (obj.hasMember(kKeyServerIP)) {
        info.SetServerIP(obj[kKeyServerIP].asString());
    }
    if (obj.hasMember(kKeyServerName)) {
        info.SetServerName(obj[kKeyServerName].asString());
    }
    if (obj.hasMember(kKeyCompress)) {
        info.SetCompression(obj[kKeyCompress].asBool());
    }
    if (obj.hasMember(kKeyBlock)) {
        info.SetBlockLevelSync(obj[kKeyBlock].asBool());
    }
    if (obj.hasMember(kKeySSH)) {
        info.SetSSH(obj[kKeySSH].asBool());
    }
    if (obj.hasMember(kKeySSHPort)) {
        info.SetSSHPort(obj[kKeySSHPort].asUInt32());
    }
    if (obj.hasMember(kKeyMaxBandwidth)) {
        info.SetMaxBandwidth(obj[kKeyMaxBandwidth].asUInt32());
    }
}

void PObj2SyncTask(const PObject& obj, SyncTask& task) {
    if (obj.hasMember(kKeyId)) {
        task.SetID(obj[kKeyId].asUInt64());
    }

    // The info is rebuilt from defaults: a missing key means the default, not the old value.
    TaskInfo info;
    SyncInfo sync_info;
    Schedule schedule;

    if (obj.hasMember(kKeyName)) {
        info.SetName(obj[kKeyName].asString());
    }
    if (obj.hasMember(kKeyShareList)) {
        std::list<std::string> shares;
        for (const PObject& share : obj[kKeyShareList].asArray()) {
            shares.push_back(share.asString());
        }
        info.SetShareList(shares);
    }
    PObj2SyncInfo(obj, sync_info);
    if (obj.hasMember(kKeyMode)) {
        schedule.SetMode(static_cast<SCHD_MODE>(obj[kKeyMode].asInt32()));
    }
    if (obj.hasMember(kKeyWeekSchedule)) {
        schedule.SetWeekSchedule(obj[kKeyWeekSchedule].asString());
    }
    // The period before the repeat count: the setters are coupled, so a period of 0 clears the
    // count and a count of 0 read afterwards clears the period.
    if (obj.hasMember(kKeyPeriodHour) && obj.hasMember(kKeyPeriodMinute)) {
        schedule.SetPeriod(obj[kKeyPeriodHour].asInt32(), obj[kKeyPeriodMinute].asInt32());
    }
    if (obj.hasMember(kKeyRepeat)) {
        schedule.SetRepeatTimesInDay(obj[kKeyRepeat].asInt32());
    }
    if (obj.hasMember(kKeyBeginYear)) {
        schedule.SetBeginYear(obj[kKeyBeginYear].asInt32());
    }
    if (obj.hasMember(kKeyBeginMonth)) {
        schedule.SetBeginMonth(obj[kKeyBeginMonth].asInt32());
    }
    if (obj.hasMember(kKeyBeginDay)) {
        schedule.SetBeginDay(obj[kKeyBeginDay].asInt32());
    }
    if (obj.hasMember(kKeyBeginHour)) {
        schedule.SetStartHour(obj[kKeyBeginHour].asInt32());
    }
    if (obj.hasMember(kKeyBeginMinute)) {
        schedule.SetStartMinute(obj[kKeyBeginMinute].asInt32());
    }

    info.SetSchedule(schedule);
    info.SetSyncInfo(sync_info);
    task.SetInfo(info);
}

void PObj2SyncTask(const PObject& obj, SyncTask& task, TASK_STATUS& status, TASK_RESULT& result) {
    PObj2SyncTask(obj, task);
    status = static_cast<TASK_STATUS>(obj[kKeyStatus].asInt32());
    result = static_cast<TASK_RESULT>(obj[kKeySyncResult].asInt32());
}

}  // namespace S2S
