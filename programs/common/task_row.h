// One row of the list of tasks: its content, and its packed form in messages.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace programs {

struct TaskRow {
    std::string name;
    std::string shares;  ///< separated by ","
    std::string server;
    std::string schedule;             ///< in words
    int status = 0;                   ///< ZEL::TASK_STATUS
    int result = 0;                   ///< ZEL::TASK_RESULT
    std::optional<int64_t> last_end;  ///< seconds since the epoch
    std::optional<int64_t> next_run;
    std::optional<uint64_t> retry_in;  ///< seconds
    std::string progress;              ///< of the current run, as text
    uint64_t pending = 0;              ///< number of changes
    std::string note;                  ///< empty when there is nothing to report
    std::string error;                 ///< why the last run failed; empty when it succeeded
};

/// The row as a string of less than 65536 bytes, as described in docs/daemon-protocol.md. Control
/// characters become "?", and texts that are too long are cut.
std::string PackTaskRow(const TaskRow& row);
/// The reverse; false when the string is not a packed row.
bool UnpackTaskRow(std::string_view packed, TaskRow& row);

// Texts for people.

/// "idle", "waiting", "running", "paused", "confirm"
const char* TaskStatusWord(int status);
/// "done", "failed", "cancelled", "not yet"
const char* TaskResultWord(int result);
/// "running 45%", "nothing has moved for 2:10", "retry in 0:20" unless it waits for a person, or
/// the status
std::string TaskStateWords(const TaskRow& row);
/// "done 2026-11-21 08:30:00"
std::string TaskLastRunWords(const TaskRow& row);

/// The list of tasks, without line ends: a table whose lines have at most `width` columns (0: no
/// limit). Notes and errors of a task follow below its row.
std::vector<std::string> TaskLines(std::vector<TaskRow> rows, size_t width);

}  // namespace programs
