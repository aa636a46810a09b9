// All settings of a task: those that the library knows, and those that only the programs know.
#pragma once

#include <string>
#include <vector>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"
#include "programs/common/bandwidth.h"

namespace programs {

struct TaskSettings {
    ZEL::SyncTask task;
    ZEL::PObject own;  ///< by key; has all keys of OwnDefaults()

    TaskSettings();

    uint64_t ID() const { return task.GetID(); }
    std::string Name() const { return task.GetInfo().GetName(); }
    const ZEL::TaskInfo& Info() const { return task.GetInfo(); }

    // One of the programs' own settings. Throws std::out_of_range for an unknown key.
    uint64_t Number(const std::string& key) const { return own.asMap().at(key).asUInt64(); }
    std::string Text(const std::string& key) const { return own.asMap().at(key).asString(); }
    std::vector<std::string> Texts(const std::string& key) const;

    /// What its runs may use of the network.
    Bandwidth Limits() const;
    /// rsync patterns of all files that are not sent.
    std::vector<std::string> ExcludeRules() const;

    /// The settings by key, and the id.
    ZEL::PObject ToMap() const;
    /// The reverse; nothing is checked, and missing keys get their defaults.
    void SetMap(const ZEL::PObject& map);

    bool SameAs(const TaskSettings& other) const;

    /// Changes the settings in `said`; unknown keys are ignored. Throws Failure (kUsage, -4),
    /// without any change, when a value or the resulting task is invalid. It does not check whether
    /// the shares exist.
    void Apply(const ZEL::PObject& said);
};

/// The schedule of a task with only these settings. Throws as Apply() does.
ZEL::Schedule ScheduleFrom(const ZEL::PObject& said);

}  // namespace programs
