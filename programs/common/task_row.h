// One line of the list of tasks: what it says, and how it travels.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace programs {

struct TaskRow {
    std::string name;
    std::string shares;  ///< joined by ","
    std::string server;
    std::string schedule;             ///< in words
    int status = 0;                   ///< ZEL::TASK_STATUS
    int result = 0;                   ///< ZEL::TASK_RESULT
    std::optional<int64_t> last_end;  ///< seconds since the epoch
    std::optional<int64_t> next_run;
    std::optional<uint64_t> retry_in;  ///< seconds
    std::string progress;              ///< of the run that is under way, in words
    uint64_t pending = 0;              ///< changes
    std::string note;                  ///< empty when all is well
    std::string error;                 ///< why the last run failed; empty when it did not
};

/// The row as one string of less than 65536 bytes, as docs/daemon-protocol.md has it: its control
/// characters are "?", and texts that are too long are cut.
std::string PackTaskRow(const TaskRow& row);
/// The reverse; false for a string that is none.
bool UnpackTaskRow(std::string_view packed, TaskRow& row);

// What a person reads of it.

/// "idle", "waiting", "running", "paused"
const char* TaskStatusWord(int status);
/// "done", "failed", "cancelled", "not yet"
const char* TaskResultWord(int result);
/// "running 45%", "nothing has moved for 2:10", "retry in 0:20", or the status
std::string TaskStateWords(const TaskRow& row);
/// "done 2026-11-21 08:30:00"
std::string TaskLastRunWords(const TaskRow& row);

/// The list of tasks, without line ends: a table whose lines have at most `width` columns (0: no
/// limit), and below the row of a task what a person should know of it.
std::vector<std::string> TaskLines(std::vector<TaskRow> rows, size_t width);

}  // namespace programs
