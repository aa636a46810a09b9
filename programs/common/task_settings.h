// A task's settings in one piece: what the library knows of them, and what is the programs' own.
#pragma once

#include <string>
#include <vector>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"

namespace programs {

struct TaskSettings {
    ZEL::SyncTask task;
    ZEL::PObject own;  ///< by key; all that OwnDefaults() has

    TaskSettings();

    uint64_t ID() const { return task.GetID(); }
    std::string Name() const { return task.GetInfo().GetName(); }
    const ZEL::TaskInfo& Info() const { return task.GetInfo(); }

    // A setting of ours. Throws std::out_of_range for a key that is not in the table.
    uint64_t Number(const std::string& key) const { return own.asMap().at(key).asUInt64(); }
    std::string Text(const std::string& key) const { return own.asMap().at(key).asString(); }
    std::vector<std::string> Texts(const std::string& key) const;

    /// rsync patterns of all that stays behind.
    std::vector<std::string> ExcludeRules() const;

    /// The settings by key, and the id.
    ZEL::PObject ToMap() const;
    /// The reverse; nothing is checked, and what the map lacks has its default.
    void SetMap(const ZEL::PObject& map);

    bool SameAs(const TaskSettings& other) const;

    /// Changes what `said` has keys for; other keys of it are not looked at. Throws Failure
    /// (kUsage, -4), and has changed nothing, when a value does not pass, or the task would not.
    /// Shares are not looked up.
    void Apply(const ZEL::PObject& said);
};

/// The schedule of a task of which only this has been said. Throws as Apply() does.
ZEL::Schedule ScheduleFrom(const ZEL::PObject& said);

}  // namespace programs
