// The commands about tasks; the daemon keeps them.
#pragma once

#include <string>

#include "ZEL/pobject.h"

namespace zelctl {

/// What is said of a task.
struct EditOptions {
    ZEL::PObject said;          ///< its settings, by key; what is not said has none
    std::string password_file;  ///< as programs::ReadPassword takes it
    bool new_password = false;  ///< of an edit: ask for one
    bool no_check = false;      ///< do not ask the server first
};

/// A task that the server refuses for good is not added.
void AddTask(const std::string& name, const EditOptions& options);
/// The password stays unless there is a file with one, or it is to be asked for; the server is
/// asked only then.
void EditTask(const std::string& name, const EditOptions& options);
void ListTasksAsJson();
void ShowTask(const std::string& name, bool as_json);
/// `command` is one that says no more than the task's name: "task_remove", "task_cancel",
/// "task_pause" or "task_resume"; `done` what has happened then.
void TellTask(const char* command, const std::string& name, const char* done);
void ShowTaskLog(const std::string& name, unsigned int limit, bool details, bool as_json);
void ShowTaskRuns(const std::string& name, unsigned int count, bool as_json);
void ShowDaemonStatus(bool as_json);
void ReloadDaemon();

}  // namespace zelctl
