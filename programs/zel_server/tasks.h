// What clients report about their tasks: that one is alive, or idle.
//
// Each task has a section of its own in the registry, TASK_<client>/<account>/<task>: reports of
// one account or client never affect those of another.
#pragma once

#include <cstdint>
#include <string>

namespace zel_server {

/// Maximum number of tasks of one account, and the time after which a state expires unless it is
/// renewed.
inline constexpr size_t kMaxAccountTasks = 256;
inline constexpr int64_t kTaskKeptSeconds = int64_t{90} * 24 * 60 * 60;

/// Records that the task is alive, or idle. Returns a status. Called with the registry's lock held.
/// Once a day it also removes expired states.
int RecordTask(const std::string& client, const std::string& account, const std::string& task,
               bool alive);

}  // namespace zel_server
