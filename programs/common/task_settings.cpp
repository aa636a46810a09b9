#include "programs/common/task_settings.h"

#include <algorithm>

#include "ZEL/channel.h"
#include "programs/common/failure.h"
#include "programs/common/schedule_words.h"
#include "programs/common/task_fields.h"

namespace programs {

namespace {

using ZEL::PObject;

[[noreturn]] void Refuse(const std::string& text) {
    throw Failure(FailureKind::kUsage, text, ZEL::RESULT_INVALID_ARGUMENT);
}

// Merges `said` into `settings`, and checks each value and the consistency of the schedule.
void Merge(const PObject& said, PObject& settings) {
    for (const TaskField& field : TaskFields()) {
        if (said.hasMember(field.key)) {
            const std::string fault = FaultOf(field, said[field.key]);
            if (!fault.empty()) {
                Refuse(NameOf(field) + " " + fault);
            }
            settings[field.key] = said[field.key];
        }
    }
    const std::string fault = SettleSchedule(said, settings);
    if (!fault.empty()) {
        Refuse(fault);
    }
}

void CheckSchedule(const ZEL::Schedule& schedule) {
    const std::string fault = FaultOfTimes(schedule);
    if (!fault.empty()) {
        Refuse(fault);
    }
    if (!schedule.Validate()) {
        Refuse(
            "the schedule does not pass: the start is a time of day, the begin a date since 1970, "
            "the runs of a day end before midnight, and there are at most 95 repeats");
    }
}

}  // namespace

TaskSettings::TaskSettings() : own(OwnDefaults()) {}

std::vector<std::string> TaskSettings::Texts(const std::string& key) const {
    return TextsOf(own.asMap().at(key));
}

Bandwidth TaskSettings::Limits() const {
    return Bandwidth::Of(Info().GetSyncInfo().GetMaxBandwidth(), Text("bandwidth_windows"));
}

std::vector<std::string> TaskSettings::ExcludeRules() const {
    return Texts("exclude");
}

PObject TaskSettings::ToMap() const {
    PObject map(own);
    ZEL::SyncTask2PObj(task, map);
    return map;
}

void TaskSettings::SetMap(const PObject& map) {
    ZEL::PObj2SyncTask(map, task);
    for (auto& [key, value] : own.asMap()) {
        value = map.hasMember(key) ? map[key] : DefaultSettings()[key];
    }
}

bool TaskSettings::SameAs(const TaskSettings& other) const {
    const PObject ours = ToMap();
    const PObject theirs = other.ToMap();
    return std::all_of(TaskFields().begin(), TaskFields().end(), [&](const TaskField& field) {
        const PObject& a = ours[field.key];
        const PObject& b = theirs[field.key];
        return a.asUInt64() == b.asUInt64() && a.asString() == b.asString() &&
               TextsOf(a) == TextsOf(b);
    });
}

void TaskSettings::Apply(const PObject& said) {
    PObject merged = ToMap();
    Merge(said, merged);
    for (const TaskField& field : TaskFields()) {
        if (field.required && merged[field.key].isEmpty()) {
            Refuse(NameOf(field) + " is missing");
        }
    }
    if (ServerOf(merged).empty()) {
        Refuse("server_name (--server) is missing, and so is server_ip");
    }
    TaskSettings changed;
    changed.SetMap(merged);
    CheckSchedule(changed.Info().GetSchedule());
    *this = std::move(changed);
}

ZEL::Schedule ScheduleFrom(const PObject& said) {
    PObject merged(DefaultSettings());
    Merge(said, merged);
    TaskSettings settings;
    settings.SetMap(merged);
    CheckSchedule(settings.Info().GetSchedule());
    return settings.Info().GetSchedule();
}

}  // namespace programs
