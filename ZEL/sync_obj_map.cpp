// Tasks to PObject maps and back: the mapping functions of sync_obj.h.
#include <tuple>
#include <type_traits>

#include "ZEL/sync_obj.h"

namespace ZEL {

namespace {

// One key of the map, and the accessors of the field behind it.
template <typename Record, typename Value, typename Argument>
struct Field {
    using ValueType = Value;

    constexpr Field(const char* name, Value (Record::*get)() const, void (Record::*set)(Argument))
        : key(name), getter(get), setter(set) {}

    const char* key;
    Value (Record::*getter)() const;
    void (Record::*setter)(Argument);
};

constexpr std::tuple kSyncInfoFields{
    Field{"user", &SyncInfo::GetUser, &SyncInfo::SetUser},
    Field{"pswd", &SyncInfo::GetPassword, &SyncInfo::SetPassword},
    Field{"server_ip", &SyncInfo::GetServerIP, &SyncInfo::SetServerIP},
    Field{"server_name", &SyncInfo::GetServerName, &SyncInfo::SetServerName},
    Field{"compress", &SyncInfo::UseCompression, &SyncInfo::SetCompression},
    Field{"block", &SyncInfo::UseBlockLevelSync, &SyncInfo::SetBlockLevelSync},
    Field{"ssh", &SyncInfo::UseSSH, &SyncInfo::SetSSH},
    Field{"ssh_port", &SyncInfo::GetSSHPort, &SyncInfo::SetSSHPort},
    Field{"max_bandwidth", &SyncInfo::GetMaxBandwidth, &SyncInfo::SetMaxBandwidth},
    Field{"rsync_timeout", &SyncInfo::GetRsyncTimeout, &SyncInfo::SetRsyncTimeout},
};

// All but the period, which takes two keys.
constexpr std::tuple kScheduleFields{
    Field{"schedule_mode", &Schedule::GetMode, &Schedule::SetMode},
    Field{"week_schd", &Schedule::GetWeekSchedule, &Schedule::SetWeekSchedule},
    Field{"repeat_times_in_day", &Schedule::GetRepeatTimesInDay, &Schedule::SetRepeatTimesInDay},
    Field{"schedule_begin_year", &Schedule::GetBeginYear, &Schedule::SetBeginYear},
    Field{"schedule_begin_month", &Schedule::GetBeginMonth, &Schedule::SetBeginMonth},
    Field{"schedule_begin_day", &Schedule::GetBeginDay, &Schedule::SetBeginDay},
    Field{"schedule_begin_hour", &Schedule::GetStartHour, &Schedule::SetStartHour},
    Field{"schedule_begin_min", &Schedule::GetStartMinute, &Schedule::SetStartMinute},
};

constexpr char kId[] = "id";
constexpr char kName[] = "name";
constexpr char kShareList[] = "share_list";
constexpr char kPeriodHour[] = "period_hour";
constexpr char kPeriodMinute[] = "period_minute";

template <typename Value>
Value Read(const PObject& value) {
    if constexpr (std::is_same_v<Value, std::string>) {
        return value.asString();
    } else if constexpr (std::is_same_v<Value, bool>) {
        return value.asBool();
    } else if constexpr (std::is_same_v<Value, uint32_t>) {
        return value.asUInt32();
    } else {
        return static_cast<Value>(value.asInt32());
    }
}

// The mode and all signed values are sent as signed 32-bit integers, also on hosts with a wider
// long.
template <typename Value>
void Write(const Value& value, PObject& into) {
    if constexpr (std::is_enum_v<Value> || std::is_same_v<Value, long>) {
        into = static_cast<int32_t>(value);
    } else {
        into = value;
    }
}

template <typename Record, typename... Fields>
void ReadFields(const std::tuple<Fields...>& fields, const PObject& obj, Record& record) {
    const auto read = [&](const auto& field) {
        using Value = typename std::decay_t<decltype(field)>::ValueType;
        if (obj.hasMember(field.key)) {
            (record.*field.setter)(Read<Value>(obj[field.key]));
        }
    };
    std::apply([&](const Fields&... field) { (read(field), ...); }, fields);
}

template <typename Record, typename... Fields>
void WriteFields(const std::tuple<Fields...>& fields, const Record& record, PObject& obj) {
    std::apply(
        [&](const Fields&... field) { (Write((record.*field.getter)(), obj[field.key]), ...); },
        fields);
}

Schedule ReadSchedule(const PObject& obj) {
    Schedule schedule;
    ReadFields(kScheduleFields, obj, schedule);
    // Set after the repeat count: setting either of the two to 0 also sets the other to 0.
    if (obj.hasMember(kPeriodHour) && obj.hasMember(kPeriodMinute)) {
        schedule.SetPeriod(obj[kPeriodHour].asInt32(), obj[kPeriodMinute].asInt32());
    }
    return schedule;
}

}  // namespace

void PObj2SyncInfo(const PObject& obj, SyncInfo& info) {
    ReadFields(kSyncInfoFields, obj, info);
}

void PObj2SyncTask(const PObject& obj, SyncTask& task) {
    TaskInfo info;
    if (obj.hasMember(kId)) {
        task.SetID(obj[kId].asUInt64());
    }
    if (obj.hasMember(kName)) {
        info.SetName(obj[kName].asString());
    }
    if (obj.hasMember(kShareList)) {
        std::list<std::string> shares;
        for (const PObject& share : obj[kShareList].asArray()) {
            shares.push_back(share.asString());
        }
        info.SetShareList(shares);
    }
    SyncInfo sync_info;
    PObj2SyncInfo(obj, sync_info);
    info.SetSchedule(ReadSchedule(obj));
    info.SetSyncInfo(sync_info);
    task.SetInfo(info);
}

void PObj2SyncTask(const PObject& obj, SyncTask& task, TASK_STATUS& status, TASK_RESULT& result) {
    PObj2SyncTask(obj, task);
    status = static_cast<TASK_STATUS>(obj["status"].asInt32());
    result = static_cast<TASK_RESULT>(obj["sync_result"].asInt32());
}

void TaskInfo2PObj(const TaskInfo& info, PObject& obj) {
    const std::list<std::string>& shares = info.GetShareList();
    obj[kName] = info.GetName();
    obj[kShareList] = PObject::Array(shares.begin(), shares.end());
    WriteFields(kSyncInfoFields, info.GetSyncInfo(), obj);
    const Schedule& schedule = info.GetSchedule();
    WriteFields(kScheduleFields, schedule, obj);
    Write(schedule.GetPeriodHourPart(), obj[kPeriodHour]);
    Write(schedule.GetPeriodMinutePart(), obj[kPeriodMinute]);
}

void SyncTask2PObj(const SyncTask& task, PObject& obj) {
    obj[kId] = static_cast<unsigned long long>(task.GetID());
    TaskInfo2PObj(task.GetInfo(), obj);
}

}  // namespace ZEL
