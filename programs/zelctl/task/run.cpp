#include "programs/zelctl/task/run.h"

#include <algorithm>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <map>
#include <optional>

#include "ZEL/sync_obj.h"
#include "programs/common/failure.h"
#include "programs/common/preview.h"
#include "programs/common/run_progress.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/base/interrupt.h"
#include "programs/zelctl/base/live_block.h"
#include "programs/zelctl/base/patient_output.h"
#include "programs/zelctl/task/view.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::Printable;
using std::chrono::steady_clock;
using TARQ::Backup::RunChange;
using ZEL::PObject;

constexpr std::chrono::seconds kLineEvery(10);  // when not on a terminal

/// The daemon's stream of updates about what tasks are doing.
class TaskStream {
public:
    /// An empty `name` means all tasks.
    void Open(const std::string& name) {
        PObject request;
        request["command"] = "watch";
        if (!name.empty()) {
            request["task"] = name;
        }
        connection_.Connect();
        connection_.Send(request);
    }
    /// Waits for the next update.
    void Next() { reply_ = connection_.Receive(); }
    /// Moves active tasks before idle ones.
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

/// The runs that the user waits for.
class Waiting {
public:
    /// `after`: the last run that had ended when this one was requested.
    void Add(const std::string& name, uint64_t after) { left_[name] = after; }
    bool Over() const { return left_.empty(); }
    /// Throws the worst failure of the runs, if there is one.
    void RequireSuccess() const {
        if (worst_) {
            throw programs::ReportedFailure(*worst_);
        }
    }

    /// Processes an update about the tasks.
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

    /// Called when the user interrupts.
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

    std::map<std::string, uint64_t> left_;  // by task: the last run that ended before
    std::optional<FailureKind> worst_;
    LiveBlock block_;
    steady_clock::time_point last_lines_ = steady_clock::now();
};

/// Output without a terminal: a line for each task whose state has changed.
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

/// Prints the changes found by a preview, or by a verification.
class ChangePrinter {
public:
    ChangePrinter(PatientOutput& output, bool verifies) : output_(output), verifies_(verifies) {}

    void Print(const PObject& reply) {
        const std::string share = reply["share"].asString();
        std::string text;
        for (const PObject& change : reply["changes"].asArray()) {
            const RunChange found = ChangeOf(change.asString());
            text +=
                (verifies_ ? programs::DifferenceLine(found) : programs::ChangeLine(found)) + "\n";
        }
        if (reply.hasMember("files")) {
            programs::PreviewSum sum;
            sum.files = reply["files"].asUInt64();
            sum.bytes = reply["bytes"].asUInt64();
            sum.deletions = reply["deletions"].asUInt64();
            sum.damaged = reply["damaged"].asUInt64();
            sum.missing = reply["missing"].asBool();
            text += (verifies_ ? programs::DifferencesLine(share, sum)
                               : programs::SumLine(share, sum)) +
                    "\n";
            damaged_ += sum.damaged;
            others_ += sum.files - sum.damaged + sum.deletions + (sum.missing ? 1 : 0);
        }
        output_.Write(text);
    }

    uint64_t Damaged() const { return damaged_; }
    uint64_t Others() const { return others_; }

private:
    // Parses "s 1234 path", "x 1234 path" for what is damaged, or "d path".
    static RunChange ChangeOf(const std::string& text) {
        RunChange change;
        change.kind = text[0] == 'd' ? RunChange::DELETE : RunChange::SEND;
        change.damaged = text[0] == 'x';
        size_t path = std::min<size_t>(2, text.size());
        if (change.kind == RunChange::SEND) {
            const char* const end = text.data() + text.size();
            const auto [stopped, error] = std::from_chars(&text[path], end, change.length);
            path = std::min(static_cast<size_t>(stopped - text.data()) + 1, text.size());
        }
        change.path = text.substr(path);
        return change;
    }

    PatientOutput& output_;
    const bool verifies_;
    uint64_t damaged_ = 0;
    uint64_t others_ = 0;
};

// Throws Failure when the preview has failed.
void RequireSuccess(const PObject& reply) {
    const int status = reply["sync_status"].asInt32();
    if (reply.hasMember("error")) {
        throw Failure(status == 0 ? FailureKind::kLocal : programs::KindOf(status),
                      reply["error"].asString(), status);
    }
}

// Sends the request, and prints what comes until the last reply. Throws Failure.
void PrintReplies(const PObject& request, PatientOutput& output, ChangePrinter& printer) {
    DaemonConnection connection;
    connection.Connect();
    connection.Send(request);
    for (;;) {
        const PObject reply = connection.Receive();
        printer.Print(reply);
        if (reply.hasMember("end")) {
            output.Finish();
            RequireSuccess(reply);
            return;
        }
    }
}

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
    WatchForInterrupt();
    for (const std::string& name : names) {
        PatientOutput output;
        ChangePrinter printer(output, false);
        PrintReplies(TaskRequest("task_preview", name), output, printer);
    }
}

void VerifyTask(const std::string& name, const std::string& share,
                const std::vector<std::string>& paths) {
    WatchForInterrupt();
    PObject request = TaskRequest("task_verify", name);
    if (!share.empty()) {
        request["share"] = share;
    }
    for (const std::string& path : paths) {
        request["paths"].asArray().emplace_back(path);
    }
    PatientOutput output;
    ChangePrinter printer(output, true);
    PrintReplies(request, output, printer);
    if (printer.Damaged() != 0) {
        throw Failure(FailureKind::kFailed,
                      programs::Count(printer.Damaged(), "file") +
                          " with other bytes under the same size and time: one of the two ends is "
                          "damaged, and which is not known. Nothing was changed");
    }
    if (printer.Others() != 0) {
        throw Failure(FailureKind::kFailed,
                      "the copy is not the same; what differs goes with the task's next run");
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
                stream.PutBusyFirst();  // the window may be too small for all
                block.Draw(TaskLines(stream.Tasks()));
            } else {
                lines.See(stream.Tasks());
            }
        }
    } catch (const Failure& failure) {
        // Only an end by the user counts as success.
        if (failure.Kind() != FailureKind::kCancelled) {
            throw;
        }
    }
}

}  // namespace zelctl
