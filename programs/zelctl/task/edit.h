// The commands about tasks; the daemon keeps them.
#pragma once

#include <optional>
#include <string>

#include "programs/zelctl/task/options.h"

namespace zelctl {

/// `password_file`: as programs::ReadPassword takes it. `check`: the server is asked first; a task
/// that it refuses for good is not added.
void AddTask(const std::string& name, const TaskOptions& options, const std::string& password_file,
             bool check);
/// `new_name` is empty unless the task is to be renamed. The password stays unless `new_password`
/// or a file is given; `check`: the server is asked with it first.
void EditTask(const std::string& name, const TaskOptions& options, const std::string& new_name,
              bool new_password, const std::string& password_file, bool check);
void ListTasks(bool as_json);
void ShowTask(const std::string& name, bool as_json);
/// `command` is one that says no more than the task's name: "task_remove", "task_cancel",
/// "task_pause" or "task_resume"; `done` what has happened then.
void TellTask(const char* command, const std::string& name, const char* done);
void ShowTaskLog(const std::string& name, unsigned int limit, bool details, bool as_json);
void ShowTaskRuns(const std::string& name, unsigned int count, bool as_json);
void ShowDaemonStatus(bool as_json);
void ReloadDaemon();

}  // namespace zelctl
