#include "programs/zelctl/task/edit.h"

#include <chrono>
#include <cstdio>
#include <ctime>

#include "programs/common/failure.h"
#include "programs/common/host.h"
#include "programs/common/schedule_words.h"
#include "programs/common/task_fields.h"
#include "programs/common/task_settings.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/base/interrupt.h"
#include "programs/zelctl/server/ask.h"
#include "programs/zelctl/server/connection.h"
#include "programs/zelctl/share/commands.h"
#include "programs/zelctl/task/next.h"
#include "programs/zelctl/task/view.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::Printable;
using ZEL::PObject;

constexpr std::chrono::seconds kPatience(30);
constexpr unsigned int kRunsShown = 3;  // upcoming runs, shown after a task was added or edited

std::string AskPassword(const std::string& file, const PObject& task) {
    return programs::ReadNewPassword(
        file, "Password of " + task["user"].asString() + " on " + programs::ServerOf(task) + ": ");
}

// Asks the server what the first run would ask it, with the new password. If the server cannot be
// asked now, the task is still stored; if it refuses for good, it is not.
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
    const std::string error = Printable(programs::OneLine(refusal->what()));
    if (refusal->Kind() == FailureKind::kCancelled) {
        throw Failure(FailureKind::kCancelled, "ended by the user; nothing was " + done);
    }
    if (IsRefusedForGood(*refusal)) {
        throw Failure(FailureKind::kRefused,
                      error + "; nothing was " + done + " (--no-check does not ask the server)");
    }
    programs::Report("zelctl", "warning: " + error + "; the task is " + done + " all the same");
}

// Rejects a one-time schedule in the past.
void CheckFuture(const PObject& said, const ZEL::Schedule& schedule) {
    if (said["schedule_mode"].asUInt32() == ZEL::SCHD_MODE_ONCE &&
        schedule.GetNextScheduledSeconds(time(nullptr)) == 0) {
        throw Failure(FailureKind::kUsage,
                      "'" + programs::DescribeSchedule(schedule) + "' lies in the past");
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
    ShowNextRuns(schedule, name, kRunsShown, false);
}

// The daemon's task of that name.
PObject GetTask(const std::string& name) {
    return std::move(AskDaemon(TaskRequest("task_show", name))["task"]);
}

}  // namespace

void AddTask(const std::string& name, const EditOptions& options) {
    PObject said(options.said);
    said["name"] = name;
    programs::TaskSettings task;
    task.Apply(said);
    CheckShares(programs::TextsOf(said["share_list"]));
    CheckFuture(said, task.Info().GetSchedule());
    DaemonConnection().Connect();  // fails before any prompt if the daemon is not running
    MeetServer(programs::ServerOf(said), WishOf(said, options.trust));
    said["pswd"] = AskPassword(options.password_file, said);
    if (!options.no_check) {
        task.Apply(said);
        TryServer(task.Info(), "added");
    }
    said["command"] = "task_add";
    ShowStored(AskDaemon(said), "added");
}

// The request contains only the given settings. The task is looked up only when they cannot be
// checked, or the password cannot be asked for, without the rest.
void EditTask(const std::string& name, const EditOptions& options) {
    PObject said(options.said);
    CheckShares(programs::TextsOf(options.said["share_list"]));
    const bool has_password = options.new_password || !options.password_file.empty();
    const TrustWish wish = WishOf(said, options.trust);
    if (said.hasMember("server_name") || said.hasMember("server_ip") || !wish.IsEmpty()) {
        const bool names_it = !programs::ServerOf(said).empty();
        MeetServer(programs::ServerOf(names_it ? said : GetTask(name)), wish);
    }
    if (has_password || options.said["schedule_mode"].asUInt32() == ZEL::SCHD_MODE_ONCE) {
        programs::TaskSettings task;
        task.SetMap(GetTask(name));
        task.Apply(said);
        CheckFuture(said, task.Info().GetSchedule());
        if (has_password) {
            said["pswd"] = AskPassword(options.password_file, task.ToMap());
            task.Apply(said);
        }
        if (has_password && !options.no_check) {
            TryServer(task.Info(), "changed");
        }
    }
    said["command"] = "task_edit";
    said["task"] = name;
    const PObject reply = AskDaemon(said);
    if (reply["changed"].isInteger() && !reply["changed"].asBool()) {
        printf("Task '%s' is so already.\n", Printable(name).c_str());
        return;
    }
    ShowStored(reply, "changed");
    if (reply["password_forgotten"].asBool()) {
        puts(("Its password is forgotten, because it was given for another server or account: "
              "'zelctl task edit " +
              Printable(reply["task"]["name"].asString()) + " --password' gives it one.")
                 .c_str());
    }
}

void ListTasksAsJson() {
    PObject request;
    request["command"] = "task_list";
    PrintTasks(AskDaemon(request)["tasks"].asArray());
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
    ShowNextRuns(record.GetInfo().GetSchedule(), Printable(name), count, as_json);
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
