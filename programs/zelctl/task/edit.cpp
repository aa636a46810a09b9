#include "programs/zelctl/task/edit.h"

#include <chrono>
#include <cstdio>
#include <ctime>

#include "programs/common/failure.h"
#include "programs/common/host.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/base/interrupt.h"
#include "programs/zelctl/server/ask.h"
#include "programs/zelctl/task/next.h"
#include "programs/zelctl/task/view.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::Printable;
using ZEL::PObject;

constexpr std::chrono::seconds kPatience(30);
constexpr unsigned int kRunsShown = 3;  // after a task has been added or edited

void AskPassword(const std::string& file, ZEL::TaskInfo& info) {
    ZEL::SyncInfo sync = info.GetSyncInfo();
    const std::string server =
        sync.GetServerName().empty() ? sync.GetServerIP() : sync.GetServerName();
    sync.SetPassword(
        programs::ReadNewPassword(file, "Password of " + sync.GetUser() + " on " + server + ": "));
    info.SetSyncInfo(sync);
}

// Asks the server, with a password that has just been given, what the first run would ask. A server
// that cannot be asked now keeps nobody from adding a task; one that will never take it does.
void TryServer(const ZEL::TaskInfo& info, const std::string& done) {
    const std::string problem = programs::PrepareHost();
    if (!problem.empty()) {
        programs::Report("zelctl", "the server was not asked: " + Printable(problem));
        return;
    }
    WatchForInterrupt();
    const std::list<std::string>& shares = info.GetShareList();
    const auto refusal = AskServer(info.GetSyncInfo(), {shares.begin(), shares.end()}, kPatience);
    if (!refusal) {
        puts("The server takes the account and the shares.");
        return;
    }
    const std::string error = Printable(OneLine(refusal->what()));
    if (refusal->Kind() == FailureKind::kCancelled) {
        throw Failure(FailureKind::kCancelled, "ended by the user; nothing was " + done);
    }
    if (IsRefusedForGood(*refusal)) {
        throw Failure(FailureKind::kRefused,
                      error + "; nothing was " + done + " (--no-check does not ask the server)");
    }
    programs::Report("zelctl", "warning: " + error + "; the task is " + done + " all the same");
}

// A date in the past is no wish for a task.
void CheckFuture(const TaskOptions& options, const ZEL::Schedule& schedule) {
    if (options.schedule.once && schedule.GetNextScheduledSeconds(time(nullptr)) == 0) {
        throw Failure(FailureKind::kUsage,
                      "'" + programs::DescribeSchedule(schedule) + "' lies in the past");
    }
}

// What there is to do without a schedule's next runs; empty when there are any.
std::string WithoutRuns(const ZEL::Schedule& schedule, const std::string& name) {
    switch (schedule.GetMode()) {
        case ZEL::SCHD_MODE_MANUAL:
            return "It runs when you ask for it: zelctl task run " + name;
        case ZEL::SCHD_MODE_REALTIME:
            return "It runs whenever something changes in its shares.";
        default:
            return schedule.GetNextScheduledSeconds(time(nullptr)) == 0
                       ? "Its schedule is over: no further run will come."
                       : "";
    }
}

void ShowStored(const PObject& reply, const char* done) {
    const PObject& task = reply["task"];
    ZEL::SyncTask record;
    ZEL::PObj2SyncTask(task, record);
    const ZEL::Schedule& schedule = record.GetInfo().GetSchedule();
    const std::string name = Printable(record.GetInfo().GetName());
    printf("Task '%s' is %s: %s.\n", name.c_str(), done,
           programs::DescribeSchedule(schedule).c_str());
    const std::string missing_day = programs::DescribeMissingDay(schedule);
    if (!missing_day.empty()) {
        puts(missing_day.c_str());
    }
    const std::string words = WithoutRuns(schedule, name);
    if (!words.empty()) {
        puts(words.c_str());
        return;
    }
    ShowNextRuns(schedule, time(nullptr), kRunsShown, false);
}

// The daemon's task of that name.
PObject GetTask(const std::string& name) {
    return std::move(AskDaemon(TaskRequest("task_show", name))["task"]);
}

}  // namespace

void AddTask(const std::string& name, const TaskOptions& options, const std::string& password_file,
             bool check) {
    CheckTaskName(name);
    ZEL::TaskInfo info;
    info.SetName(name);
    options.ApplyTo(info);
    CheckFuture(options, info.GetSchedule());
    DaemonConnection().Connect();  // nobody types a password for a daemon that is not there
    AskPassword(password_file, info);
    CheckTask(info);
    if (check) {
        TryServer(info, "added");
    }
    PObject request;
    ZEL::TaskInfo2PObj(info, request);
    request["command"] = "task_add";
    if (options.excludes) {
        request["exclude"] = ToArray(*options.excludes);
    }
    ShowStored(AskDaemon(request), "added");
}

void EditTask(const std::string& name, const TaskOptions& options, const std::string& new_name,
              bool new_password, const std::string& password_file, bool check) {
    if (!new_name.empty()) {
        CheckTaskName(new_name);
    }
    const PObject shown = GetTask(name);
    ZEL::SyncTask record;
    ZEL::PObj2SyncTask(shown, record);
    ZEL::TaskInfo& info = record.GetInfo();
    PObject before;
    ZEL::TaskInfo2PObj(info, before);
    before["exclude"] = shown["exclude"];

    if (!new_name.empty()) {
        info.SetName(new_name);
    }
    options.ApplyTo(info);
    CheckFuture(options, info.GetSchedule());
    const bool has_password = new_password || !password_file.empty();
    if (has_password) {
        AskPassword(password_file, info);
    }
    // Shares that the task has had before are not looked at: a disk that is away for now must not
    // keep anybody from changing a time.
    if (!(info.GetSyncInfo().Validate() && info.GetSchedule().Validate())) {
        CheckTask(info);
    }
    if (check && has_password) {
        TryServer(info, "changed");
    }
    PObject after;
    ZEL::TaskInfo2PObj(info, after);
    if (options.excludes) {
        after["exclude"] = ToArray(*options.excludes);
    }
    PObject request = TaskRequest("task_edit", name);
    bool changed = false;
    for (const auto& [key, value] : after.asMap()) {
        if (value.toString() != before[key].toString()) {
            request[key] = value;
            changed = true;
        }
    }
    if (!changed) {
        printf("Task '%s' is so already.\n", Printable(name).c_str());
        return;
    }
    ShowStored(AskDaemon(request), "changed");
}

void ListTasks(bool as_json) {
    PObject request;
    request["command"] = "task_list";
    if (!as_json) {
        request["brief"] = 1;
    }
    PrintTasks(AskDaemon(request)["tasks"].asArray(), as_json);
}

void ShowTask(const std::string& name, bool as_json) {
    PrintTask(GetTask(name), as_json);
}

void TellTask(const char* command, const std::string& name, const char* done) {
    AskDaemon(TaskRequest(command, name));
    printf("Task '%s' %s.\n", Printable(name).c_str(), done);
}

void ShowTaskLog(const std::string& name, unsigned int limit, bool details, bool as_json) {
    PObject request = TaskRequest("task_log", name);
    request["limit"] = limit;
    request["details"] = details;
    PrintRuns(AskDaemon(request)["runs"].asArray(), as_json);
}

void ShowTaskRuns(const std::string& name, unsigned int count, bool as_json) {
    ZEL::SyncTask record;
    ZEL::PObj2SyncTask(GetTask(name), record);
    const ZEL::Schedule& schedule = record.GetInfo().GetSchedule();
    const std::string words = WithoutRuns(schedule, Printable(name));
    if (!words.empty() && !as_json) {
        puts(words.c_str());
        return;
    }
    ShowNextRuns(schedule, time(nullptr), words.empty() ? count : 0, as_json);
}

void ShowDaemonStatus(bool as_json) {
    PObject request;
    request["command"] = "daemon_status";
    PrintDaemonStatus(AskDaemon(request), as_json);
}

void ReloadDaemon() {
    PObject request;
    request["command"] = "reload";
    AskDaemon(request);
    puts("The daemon has read its configuration and the share catalogue again.");
}

}  // namespace zelctl
