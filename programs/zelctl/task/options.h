// What the command line says of a task, and checking it.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"
#include "programs/common/schedule_words.h"

namespace zelctl {

/// What is not given stays unset, and as it is in the task.
struct TaskOptions {
    std::vector<std::string> shares;
    std::optional<std::string> server;  ///< name or address
    std::optional<std::string> user;
    std::optional<bool> ssh;
    std::optional<bool> compress;
    std::optional<bool> delta;
    std::optional<unsigned int> ssh_port;
    std::optional<unsigned int> timeout;          ///< seconds
    std::optional<unsigned int> bandwidth_limit;  ///< KiB a second; 0: none
    std::optional<std::vector<std::string>> excludes;
    programs::ScheduleWords schedule;

    /// Changes the task to what is given, all checked; the shares are looked up on this machine.
    void ApplyTo(ZEL::TaskInfo& info) const;
};

/// Throws Failure when `name` cannot be a task's.
void CheckTaskName(const std::string& name);

/// The library's own check, as the last word after ours.
void CheckTask(const ZEL::TaskInfo& info);

/// Texts as the array that a request carries.
ZEL::PObject ToArray(const std::vector<std::string>& texts);

}  // namespace zelctl
