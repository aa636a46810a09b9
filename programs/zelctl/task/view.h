// What a person, or a program, is shown of tasks and their runs.
#pragma once

#include <nlohmann/json_fwd.hpp>
#include <string>
#include <vector>

#include "ZEL/pobject.h"
#include "programs/common/task_row.h"

namespace zelctl {

// Of a task as the daemon tells it (docs/daemon-protocol.md). Texts are the daemon's bytes: tables
// show them printable, other places have to.

programs::TaskRow RowOf(const ZEL::PObject& task);

/// The list of tasks as this terminal shows it.
std::vector<std::string> TaskLines(const ZEL::PObject::Array& tasks);

void PrintTasks(const ZEL::PObject::Array& tasks);  ///< as JSON
void PrintTask(const ZEL::PObject& task, bool as_json);
void PrintRuns(const ZEL::PObject::Array& runs, bool as_json);
void PrintDaemonStatus(const ZEL::PObject& status, bool as_json);

/// Any value as JSON.
nlohmann::ordered_json ToJson(const ZEL::PObject& value);
/// Writes it to standard output; bytes that are not UTF-8 are replaced.
void PrintJson(const nlohmann::ordered_json& json);

}  // namespace zelctl
