// Output about tasks and their runs, for people and for programs.
#pragma once

#include <nlohmann/json_fwd.hpp>
#include <string>
#include <vector>

#include "ZEL/pobject.h"
#include "programs/common/task_row.h"

namespace zelctl {

// Tasks are the daemon's maps (docs/daemon-protocol.md). Their texts are not escaped: tables print
// them safely, other code has to call Printable().

programs::TaskRow RowOf(const ZEL::PObject& task);

/// The list of tasks, fitted to this terminal.
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
