// A task's record as a row of the store.
#pragma once

#include <string>

#include "programs/common/failure.h"
#include "programs/zel_daemon/sqlite.h"
#include "programs/zel_daemon/task_record.h"

namespace zel_daemon {

/// A row holds what no record can be made of.
inline programs::Failure RowError(const std::string& what) {
    return {
        programs::FailureKind::kLocal,
        what + "; mend it, or remove the row, in the sqlite3 shell while the daemon is stopped"};
}

/// The names of a task's columns but for the id, with commas between, and a "?" for each.
std::string TaskColumns();
std::string TaskParameters();

/// Binds the values of TaskColumns().
void BindTask(Query& query, const TaskRecord& record);
/// Reads the id and the values of TaskColumns(). Throws RowError().
TaskRecord ReadTask(Query& query);

}  // namespace zel_daemon
