#include "programs/zelctl/task/run.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <map>
#include <optional>

#include "ZEL/sync_obj.h"
#include "programs/common/failure.h"
#include "programs/common/run_progress.h"
#include "programs/common/task_fields.h"
#include "programs/common/task_run.h"
#include "programs/common/task_settings.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/base/interrupt.h"
#include "programs/zelctl/base/live_block.h"
#include "programs/zelctl/push/push.h"
#include "programs/zelctl/task/view.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::Printable;
using std::chrono::steady_clock;
using ZEL::PObject;

constexpr std::chrono::seconds kLineEvery(10);  // where there is no terminal

/// The daemon's stream of what tasks are doing.
class TaskStream {
public:
    /// `name` is empty for all tasks.
    void Open(const std::string& name) {
        PObject request;
        request["command"] = "watch";
        if (!name.empty()) {
            request["task"] = name;
        }
        connection_.Connect();
        connection_.Send(request);
    }
    /// Waits for the next news.
    void Next() { reply_ = connection_.Receive(); }
    /// Puts the tasks that do something before those that do not.
    void PutBusyFirst() {
        PObject::Array& tasks = reply_["tasks"].asArray();
        std::stable_partition(tasks.begin(), tasks.end(), [](const PObject& task) {
            const int status = task["status"].asInt32();
            return status == ZEL::TASK_STATUS_WAITING || status == ZEL::TASK_STATUS_RUNNING;
        });
    }
    const PObject::Array& Tasks() const {
        return static_cast<const PObject&>(reply_)["tasks"].asArray();
    }

private:
    DaemonConnection connection_;
    PObject reply_;
};

const PObject* FindTask(const PObject::Array& tasks, const std::string& name) {
    const auto found = std::find_if(tasks.begin(), tasks.end(), [&](const PObject& task) {
        return task["name"].asString() == name;
    });
    return found == tasks.end() ? nullptr : &*found;
}

std::string WaitingLine(const PObject& task) {
    const std::string name = task["name"].asString();
    const std::string share = task["progress_share"].asString();
    if (task["status"].asInt32() != ZEL::TASK_STATUS_RUNNING || share.empty()) {
        return Printable(name) + ": " + programs::TaskStateWords(RowOf(task));
    }
    const TARQ::Backup::RunProgress progress = programs::ProgressOf(task);
    const std::string what = name == share ? name : name + " " + share;
    return LiveBlock::Possible() ? programs::ProgressLine(what, progress, LiveBlock::Columns())
                                 : Printable(what) + ": " + programs::ProgressWords(progress);
}

/// The runs that a person waits for.
class Waiting {
public:
    /// `after`: the run that had ended when this one was asked for.
    void Add(const std::string& name, uint64_t after) { left_[name] = after; }
    bool Over() const { return left_.empty(); }
    /// Throws what the worst of them comes to.
    void RequireSuccess() const {
        if (worst_) {
            throw programs::ReportedFailure(*worst_);
        }
    }

    /// Takes in what the tasks are doing.
    void See(const PObject::Array& tasks) {
        std::vector<std::string> lines;
        for (auto run = left_.begin(); run != left_.end();) {
            const PObject* const task = FindTask(tasks, run->first);
            if (task == nullptr || (*task)["last_run"].asUInt64() != run->second) {
                block_.Clear();
                task == nullptr
                    ? Failed(FailureKind::kFailed, run->first, " has been removed or renamed")
                    : Ended(*task);
                run = left_.erase(run);
            } else {
                lines.push_back(WaitingLine(*task));
                ++run;
            }
        }
        if (LiveBlock::Possible()) {
            block_.Draw(lines);
        } else if (steady_clock::now() - last_lines_ >= kLineEvery) {
            last_lines_ = steady_clock::now();
            for (const std::string& line : lines) {
                puts(line.c_str());
            }
            fflush(stdout);
        }
    }

    /// The user has had enough.
    void Leave() {
        block_.Clear();
        for (const auto& [name, after] : left_) {
            programs::Report("zelctl", "no longer waiting; the run of '" + Printable(name) +
                                           "' goes on: 'zelctl task watch' looks on, 'zelctl task "
                                           "cancel' ends it");
        }
    }

private:
    void Failed(FailureKind kind, const std::string& task, const std::string& text) {
        programs::Report("zelctl", "task '" + Printable(task) + "'" + text);
        worst_ = std::max(worst_.value_or(kind), kind);
    }

    void Ended(const PObject& task) {
        const std::string& name = task["name"].asString();
        const int64_t took = task["last_end"].asInt64() - task["last_start"].asInt64();
        const std::string took_words =
            programs::HumanDuration(static_cast<uint64_t>(std::max<int64_t>(took, 0)));
        switch (task["sync_result"].asInt32()) {
            case ZEL::TASK_RESULT_SUCCESS:
                printf("%s: done in %s\n", Printable(name).c_str(), took_words.c_str());
                fflush(stdout);
                return;
            case ZEL::TASK_RESULT_CANCELLED:
                return Failed(FailureKind::kCancelled, name, ": the run was cancelled");
            default: {
                const int status = task["last_status"].asInt32();
                return Failed(status == 0 ? FailureKind::kLocal : programs::KindOf(status), name,
                              " failed after " + took_words + ": " +
                                  Printable(programs::OneLine(task["last_error"].asString())));
            }
        }
    }

    std::map<std::string, uint64_t> left_;  // by task, the last run before
    std::optional<FailureKind> worst_;
    LiveBlock block_;
    steady_clock::time_point last_lines_ = steady_clock::now();
};

/// Where there is no terminal: a line for each task whose state is another than before.
class ChangeLines {
public:
    void See(const PObject::Array& tasks) {
        for (const PObject& task : tasks) {
            const programs::TaskRow row = RowOf(task);
            std::string line = Printable(task["name"].asString()) + ": " +
                               programs::TaskStateWords(row) + ", last run " +
                               programs::TaskResultWord(row.result) +
                               (row.error.empty() ? "" : ": " + Printable(row.error));
            std::string& before = lines_[task["name"].asString()];
            if (line != before) {
                printf("%s  %s\n", programs::HumanTime(time(nullptr)).c_str(), line.c_str());
                before = std::move(line);
            }
        }
        fflush(stdout);
    }

private:
    std::map<std::string, std::string> lines_;
};

}  // namespace

void RunTasks(const std::vector<std::string>& names, bool wait) {
    Waiting waiting;
    for (const std::string& name : names) {
        const PObject reply = AskDaemon(TaskRequest("task_run", name));
        waiting.Add(name, reply["after"].asUInt64());
        if (!wait) {
            printf("Task '%s' runs as soon as a worker is free.\n", Printable(name).c_str());
        }
    }
    if (!wait) {
        return;
    }
    WatchForInterrupt();
    try {
        TaskStream stream;
        stream.Open(names.size() == 1 ? names[0] : "");
        while (!waiting.Over()) {
            stream.Next();
            waiting.See(stream.Tasks());
        }
    } catch (const Failure& failure) {
        if (failure.Kind() == FailureKind::kCancelled) {
            waiting.Leave();
        }
        throw;
    }
    waiting.RequireSuccess();
}

void ListTaskChanges(const std::vector<std::string>& names) {
    for (const std::string& name : names) {
        PObject request = TaskRequest("task_show", name);
        request["secrets"] = 1;
        const PObject reply = AskDaemon(request);
        programs::TaskSettings task;
        task.SetMap(reply["task"]);
        PushOptions options;
        options.shares = programs::TextsOf(reply["task"]["share_list"]);
        options.excludes = task.ExcludeRules();
        options.connection.server = programs::ServerOf(reply["task"]);
        options.info = task.Info().GetSyncInfo();
        options.dry_run = true;
        Push(options);
    }
}

void WatchTasks(const std::string& name) {
    WatchForInterrupt();
    TaskStream stream;
    LiveBlock block;
    ChangeLines lines;
    try {
        for (stream.Open(name);;) {
            stream.Next();
            if (LiveBlock::Possible()) {
                stream.PutBusyFirst();  // a window may not hold all
                block.Draw(TaskLines(stream.Tasks()));
            } else {
                lines.See(stream.Tasks());
            }
        }
    } catch (const Failure& failure) {
        // The user's own end is the only good one.
        if (failure.Kind() != FailureKind::kCancelled) {
            throw;
        }
    }
}

}  // namespace zelctl
