// The commands that change the tasks, which the daemon stores.
#pragma once

#include <string>

#include "ZEL/pobject.h"
#include "programs/zelctl/server/trust.h"

namespace zelctl {

/// The options of `task add` and `task edit`.
struct EditOptions {
    ZEL::PObject said;          ///< the given settings, by key
    TrustWish trust;            ///< how to reach the server
    std::string password_file;  ///< see programs::ReadPassword
    bool new_password = false;  ///< for an edit: ask for a new one
    bool no_check = false;      ///< do not ask the server in advance
};

/// Adds a task, unless the server refuses it for good.
void AddTask(const std::string& name, const EditOptions& options);
/// Changes a task. The password is kept unless `options` provide or request a new one; only then is
/// the server asked in advance.
void EditTask(const std::string& name, const EditOptions& options);
void ListTasksAsJson();
void ShowTask(const std::string& name, bool as_json);
/// Sends `command`, whose only argument is the task's name: "task_remove", "task_cancel",
/// "task_confirm", "task_pause" or "task_resume". `done`: what is printed on success.
void TellTask(const char* command, const std::string& name, const char* done);
void ShowTaskLog(const std::string& name, unsigned int limit, bool details, bool as_json);
void ShowTaskRuns(const std::string& name, unsigned int count, bool as_json);
void ShowDaemonStatus(bool as_json);
void ReloadDaemon();

}  // namespace zelctl
