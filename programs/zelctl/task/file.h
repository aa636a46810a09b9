// Tasks as a JSON file, for export and import.
//
//     {"format": "zelctl tasks", "version": 1, "tasks": [{"name": "nightly", ...}]}
//
// A task has the keys that the daemon's task map has (docs/daemon-protocol.md), of its
// configuration alone; switches are true and false. What is missing has its default.
#pragma once

#include <string>
#include <vector>

#include "ZEL/pobject.h"

namespace zelctl {

/// The file's text. The tasks' passwords are in it only when asked for.
std::string WriteTaskFile(const ZEL::PObject::Array& tasks, bool with_passwords);

struct TaskFile {
    std::vector<ZEL::PObject> tasks;  ///< maps of what the file says, with no other keys
    /// What is wrong, each with its place: the line, or the task and the key. Only when there is
    /// none do the tasks count.
    std::vector<std::string> faults;
};

/// Reads the text, which may be anybody's. Whether shares and schedules are possible is not looked
/// at.
TaskFile ReadTaskFile(const std::string& text);

}  // namespace zelctl
