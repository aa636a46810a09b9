#include "programs/zelctl/task/edit.h"

#include <chrono>
#include <cstdio>
#include <ctime>

#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/base/interrupt.h"
#include "programs/zelctl/server/ask.h"
#include "programs/zelctl/task/next.h"
#include "programs/zelctl/task/view.h"

namespace zelctl {

namespace {

using programs::Printable;
using ZEL::PObject;

constexpr std::chrono::seconds kPatience(30);
constexpr unsigned int kRunsShown = 3;  // after a task has been added or edited

ExitCode AskPassword(const std::string& file, ZEL::TaskInfo& info) {
    ZEL::SyncInfo sync = info.GetSyncInfo();
    const std::string server =
        sync.GetServerName().empty() ? sync.GetServerIP() : sync.GetServerName();
    std::string error;
    const auto password = programs::ReadNewPassword(
        file, "Password of " + sync.GetUser() + " on " + server + ": ", error);
    if (!password) {
        return Fail(kUsage, "%s", error.c_str());
    }
    sync.SetPassword(*password);
    info.SetSyncInfo(sync);
    return kOk;
}

// Asks the server, with a password that has just been given, what the first run would ask. A server
// that cannot be asked now keeps nobody from adding a task; one that will never take it does.
ExitCode TryServer(const ZEL::TaskInfo& info, const char* done) {
    const std::string problem = programs::PrepareHost();
    if (!problem.empty()) {
        fprintf(stderr, "zelctl: the server was not asked: %s\n", Printable(problem).c_str());
        return kOk;
    }
    WatchForInterrupt();
    const std::list<std::string>& shares = info.GetShareList();
    const programs::RunFailure verdict =
        AskServer(info.GetSyncInfo(), {shares.begin(), shares.end()}, kPatience);
    if (verdict.Ok()) {
        puts("The server takes the account and the shares.");
        return kOk;
    }
    const std::string error = Printable(OneLine(verdict.error));
    if (verdict.trouble == programs::Trouble::kCancelled) {
        return Fail(kCancelled, "%s; nothing was %s", "ended by the user", done);
    }
    if (IsRefusedForGood(verdict)) {
        return Fail(kRefused, "%s; nothing was %s (--no-check does not ask the server)",
                    error.c_str(), done);
    }
    fprintf(stderr, "zelctl: warning: %s; the task is %s all the same\n", error.c_str(), done);
    return kOk;
}

// A date in the past is no wish for a task.
ExitCode CheckFuture(const TaskOptions& options, const ZEL::Schedule& schedule) {
    if (options.schedule.once && schedule.GetNextScheduledSeconds(time(nullptr)) == 0) {
        return Fail(kUsage, "'%s' lies in the past", programs::DescribeSchedule(schedule).c_str());
    }
    return kOk;
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

ExitCode ShowStored(const PObject& reply, const char* done) {
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
        return kOk;
    }
    return ShowNextRuns(schedule, time(nullptr), kRunsShown, false);
}

// The daemon's task of that name.
ExitCode GetTask(const std::string& name, PObject& task) {
    PObject reply;
    const ExitCode code = AskDaemon(TaskRequest("task_show", name), reply);
    if (code == kOk) {
        task.swap(reply["task"]);
    }
    return code;
}

}  // namespace

ExitCode AddTask(const std::string& name, const TaskOptions& options,
                 const std::string& password_file, bool check) {
    ExitCode code = CheckTaskName(name);
    ZEL::TaskInfo info;
    info.SetName(name);
    if (code == kOk) {
        code = options.ApplyTo(info);
    }
    if (code == kOk) {
        code = CheckFuture(options, info.GetSchedule());
    }
    if (code == kOk) {
        // Nobody types a password for a daemon that is not there.
        DaemonConnection connection;
        code = connection.Tell(connection.Connect());
    }
    if (code == kOk) {
        code = AskPassword(password_file, info);
    }
    if (code == kOk) {
        code = CheckTask(info);
    }
    if (code == kOk && check) {
        code = TryServer(info, "added");
    }
    if (code != kOk) {
        return code;
    }
    PObject request;
    ZEL::TaskInfo2PObj(info, request);
    request["command"] = "task_add";
    if (options.excludes) {
        request["exclude"] = ToArray(*options.excludes);
    }
    PObject reply;
    code = AskDaemon(request, reply);
    return code == kOk ? ShowStored(reply, "added") : code;
}

ExitCode EditTask(const std::string& name, const TaskOptions& options, const std::string& new_name,
                  bool new_password, const std::string& password_file, bool check) {
    PObject shown;
    ExitCode code = new_name.empty() ? kOk : CheckTaskName(new_name);
    if (code == kOk) {
        code = GetTask(name, shown);
    }
    if (code != kOk) {
        return code;
    }
    ZEL::SyncTask record;
    ZEL::PObj2SyncTask(shown, record);
    ZEL::TaskInfo& info = record.GetInfo();
    PObject before;
    ZEL::TaskInfo2PObj(info, before);
    before["exclude"] = static_cast<const PObject&>(shown)["exclude"];

    if (!new_name.empty()) {
        info.SetName(new_name);
    }
    code = options.ApplyTo(info);
    if (code == kOk) {
        code = CheckFuture(options, info.GetSchedule());
    }
    const bool has_password = new_password || !password_file.empty();
    if (code == kOk && has_password) {
        code = AskPassword(password_file, info);
    }
    // Shares that the task has had before are not looked at: a disk that is away for now must not
    // keep anybody from changing a time.
    if (code == kOk && !(info.GetSyncInfo().Validate() && info.GetSchedule().Validate())) {
        code = CheckTask(info);
    }
    if (code == kOk && check && has_password) {
        code = TryServer(info, "changed");
    }
    if (code != kOk) {
        return code;
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
        return kOk;
    }
    PObject reply;
    code = AskDaemon(request, reply);
    return code == kOk ? ShowStored(reply, "changed") : code;
}

ExitCode ListTasks(bool as_json) {
    PObject request;
    request["command"] = "task_list";
    if (!as_json) {
        request["brief"] = 1;
    }
    PObject reply;
    const ExitCode code = AskDaemon(request, reply);
    if (code == kOk) {
        PrintTasks(reply["tasks"].asArray(), as_json);
    }
    return code;
}

ExitCode ShowTask(const std::string& name, bool as_json) {
    PObject task;
    const ExitCode code = GetTask(name, task);
    if (code == kOk) {
        PrintTask(task, as_json);
    }
    return code;
}

ExitCode TellTask(const char* command, const std::string& name, const char* done) {
    PObject reply;
    const ExitCode code = AskDaemon(TaskRequest(command, name), reply);
    if (code == kOk) {
        printf("Task '%s' %s.\n", Printable(name).c_str(), done);
    }
    return code;
}

ExitCode ShowTaskLog(const std::string& name, unsigned int limit, bool details, bool as_json) {
    PObject request = TaskRequest("task_log", name);
    request["limit"] = limit;
    request["details"] = details;
    PObject reply;
    const ExitCode code = AskDaemon(request, reply);
    if (code == kOk) {
        PrintRuns(reply["runs"].asArray(), as_json);
    }
    return code;
}

ExitCode ShowTaskRuns(const std::string& name, unsigned int count, bool as_json) {
    PObject task;
    const ExitCode code = GetTask(name, task);
    if (code != kOk) {
        return code;
    }
    ZEL::SyncTask record;
    ZEL::PObj2SyncTask(task, record);
    const ZEL::Schedule& schedule = record.GetInfo().GetSchedule();
    const std::string words = WithoutRuns(schedule, Printable(name));
    if (!words.empty() && !as_json) {
        puts(words.c_str());
        return kOk;
    }
    return ShowNextRuns(schedule, time(nullptr), words.empty() ? count : 0, as_json);
}

ExitCode ShowDaemonStatus(bool as_json) {
    PObject request;
    request["command"] = "daemon_status";
    PObject reply;
    const ExitCode code = AskDaemon(request, reply);
    if (code == kOk) {
        PrintDaemonStatus(reply, as_json);
    }
    return code;
}

ExitCode ReloadDaemon() {
    PObject request;
    request["command"] = "reload";
    PObject reply;
    const ExitCode code = AskDaemon(request, reply);
    if (code == kOk) {
        puts("The daemon has read its configuration and the share catalogue again.");
    }
    return code;
}

}  // namespace zelctl
