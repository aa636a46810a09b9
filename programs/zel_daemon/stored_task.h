// A task's record as a row of the store.
#pragma once

#include <stdexcept>
#include <string>

#include "programs/zel_daemon/sqlite.h"
#include "programs/zel_daemon/task_record.h"

namespace zel_daemon {

/// A row holds what no record can be made of.
class RowError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

/// The names of a task's columns but for the id, with commas between, and a "?" for each.
std::string TaskColumns();
std::string TaskParameters();

/// Binds the values of TaskColumns().
void BindTask(Query& query, const TaskRecord& record);
/// Reads the id and the values of TaskColumns(). Throws RowError.
TaskRecord ReadTask(Query& query);

}  // namespace zel_daemon
