// The doctor's checks of tasks: would the server accept them, are their folders watched, did their
// last run fail.
#include <algorithm>
#include <atomic>
#include <chrono>
#include <map>
#include <optional>
#include <system_error>
#include <thread>

#include "programs/common/run_result.h"
#include "programs/common/server_status.h"
#include "programs/common/text.h"
#include "programs/zelctl/doctor/checks.h"
#include "programs/zelctl/server/ask.h"
#include "programs/zelctl/task/view.h"

namespace zelctl {

namespace {

using ZEL::PObject;
/// Why a server does not accept a task's shares; nothing when it does.
using Refusal = std::optional<programs::RunFailure>;

constexpr std::chrono::seconds kPatience(15);
constexpr size_t kAtOnce = 8;

std::string ServerKey(const ZEL::SyncInfo& info) {
    return info.GetServerName() + "\n" + info.GetServerIP() + "\n" +
           std::to_string(info.UseSSH() ? info.GetSSHPort() : 0);
}

/// Asks the servers of many tasks, several at the same time. When a server has timed out for one
/// task, it is not asked for the others: so a thousand tasks of a dead server take no longer than a
/// few.
class ServerQuestions {
public:
    explicit ServerQuestions(const std::vector<const PatientTask*>& tasks)
        : tasks_(tasks), answers_(tasks.size()), skipped_(tasks.size(), false) {
        for (const PatientTask* task : tasks) {
            silent_[ServerKey(task->record.GetInfo().GetSyncInfo())] = false;
        }
        std::vector<std::thread> askers;
        try {
            while (askers.size() < std::min(kAtOnce, tasks.size())) {
                askers.emplace_back([this] { Ask(); });
            }
        } catch (const std::system_error&) {
            // The threads that could be started do all the work.
        }
        if (askers.empty()) {
            Ask();
        }
        for (std::thread& asker : askers) {
            asker.join();
        }
    }

    /// In the order of the tasks.
    const Refusal& Answer(size_t task) const { return answers_[task]; }
    /// Not asked, as its server has timed out for another task.
    bool Skipped(size_t task) const { return skipped_[task]; }

private:
    void Ask() {
        for (size_t i = next_++; i < tasks_.size(); i = next_++) {
            const ZEL::TaskInfo& info = tasks_[i]->record.GetInfo();
            std::atomic<bool>& silent = silent_.at(ServerKey(info.GetSyncInfo()));
            if (silent) {
                skipped_[i] = true;
                continue;
            }
            const std::list<std::string>& shares = info.GetShareList();
            answers_[i] = AskServer(info.GetSyncInfo(), {shares.begin(), shares.end()}, kPatience);
            if (answers_[i] && IsSilence(*answers_[i])) {
                silent = true;
            }
        }
    }

    const std::vector<const PatientTask*>& tasks_;
    std::atomic<size_t> next_{0};
    std::vector<Refusal> answers_;
    std::vector<char> skipped_;  // not vector<bool>: threads write neighbouring elements
    std::map<std::string, std::atomic<bool>> silent_;
};

std::string Quoted(const std::string& name) {
    return "'" + name + "'";
}

// How to solve a refusal by the server, where its error text does not say it.
std::string RemedyOfRefusal(int status, const PatientTask& task) {
    const ZEL::TaskInfo& info = task.record.GetInfo();
    switch (status) {
        case TARQ::Backup::STATUS_AUTHENTICATION:
            return "zelctl task edit " + Quoted(info.GetName()) +
                   " --password; at the server 'zel_server account add " +
                   info.GetSyncInfo().GetUser() + "' sets a new one";
        case programs::kUnknownCommand:
            return "is it the right server? If so: 'zel_server setup' there";
        default:
            return "at the server: zel_server status";
    }
}

void CheckAnswer(const Refusal& refusal, bool skipped, const PatientTask& task, Findings& found) {
    if (skipped) {
        found.push_back({"", Severity::kFailed,
                         "its server was not asked: it gave no answer for another task",
                         "see that task"});
    } else if (refusal) {
        found.push_back({"", Severity::kFailed, programs::OneLine(refusal->what()),
                         RemedyOfRefusal(refusal->Status(), task)});
    }
}

void CheckWatch(const PatientTask& task, Findings& found) {
    const PObject& state = task.state;
    if (!state["watched_folders"].isInteger() || state["watch_searching"].asBool()) {
        return;
    }
    const std::string problem = state["watch_problem"].asString();
    if (state["watched_folders"].asUInt64() == 0) {
        found.push_back({"", Severity::kFailed,
                         "nothing of it is watched" + (problem.empty() ? "" : ": " + problem),
                         "until its folders can be watched, a change is sent only with the next "
                         "whole comparison; see also the findings about its shares"});
    } else if (!state["watch_complete"].asBool()) {
        found.push_back({"", Severity::kFailed, "not all of it is watched: " + problem,
                         "changes in the other folders are sent only with the next whole "
                         "comparison"});
    }
}

void CheckLastRun(const PatientTask& task, Findings& found) {
    const PObject& state = task.state;
    if (state["last_status"].asInt32() == programs::kNotConfirmed) {
        const std::string name = Quoted(task.record.GetInfo().GetName());
        found.push_back({"", Severity::kFailed, programs::OneLine(state["last_error"].asString()),
                         "zelctl task show " + name + " lists it; zelctl task confirm " + name +
                             " lets it go once"});
        return;
    }
    if (state["sync_result"].asInt32() != ZEL::TASK_RESULT_FAILED) {
        return;
    }
    const std::string retry =
        state["retry_in"].isInteger()
            ? "it is tried again in " + programs::HumanDuration(state["retry_in"].asUInt64())
            : "it is not tried again by itself: zelctl task run " +
                  Quoted(task.record.GetInfo().GetName());
    found.push_back({"", Severity::kFailed,
                     "its last run failed at " + programs::HumanTime(state["last_end"].asInt64()) +
                         ": " + programs::OneLine(state["last_error"].asString()),
                     retry});
}

void CheckVerification(const PatientTask& task, Findings& found) {
    const std::string name = Quoted(task.record.GetInfo().GetName());
    if (const uint64_t damaged = task.state["damaged"].asUInt64()) {
        found.push_back({"", Severity::kFailed,
                         programs::Count(damaged, "file") +
                             " with other bytes at the two ends under the same size and time",
                         "zelctl task show " + name +
                             " lists them; where the server's is the right one: zelctl restore " +
                             name});
    }
    const std::string problem = task.state["verify_problem"].asString();
    if (!problem.empty()) {
        found.push_back({"", Severity::kWarning,
                         "its copies are not verified: " + programs::OneLine(problem),
                         "it is tried again; --verify off does without"});
    }
}

// The daemon's note about the task, unless it was reported already: a problem with the watch, or
// what the last run asked.
void CheckNote(const PatientTask& task, Findings& found) {
    const std::string note = task.state["note"].asString();
    const bool asks = task.state["last_status"].asInt32() == programs::kNotConfirmed;
    const bool damaged = task.state["damaged"].asUInt64() != 0;
    if (!note.empty() && !asks && !damaged && note != task.state["watch_problem"].asString()) {
        found.push_back({"", Severity::kWarning, note, "see the daemon's log"});
    }
}

std::string WellWords(const PatientTask& task, bool asked) {
    const PObject& state = task.state;
    std::string words = state["status"].asInt32() == ZEL::TASK_STATUS_PAUSED
                            ? "paused: it runs only when asked to"
                            : "last run: " + programs::TaskLastRunWords(RowOf(state));
    if (state["watched_folders"].isInteger()) {
        words += state["watch_searching"].asBool()
                     ? ", still looking for its folders"
                     : ", " + programs::Count(state["watched_folders"].asUInt64(), "folder") +
                           " watched";
    }
    return words + (asked ? ", the server takes it" : "");
}

}  // namespace

void CheckTasks(const Patient& patient, Findings& findings) {
    std::vector<const PatientTask*> asked;
    for (const PatientTask& task : patient.tasks) {
        // Unreachable servers are reported by the check of the servers.
        if (patient.has_passwords && patient.cut_off.count(task.record.GetInfo().GetName()) == 0) {
            asked.push_back(&task);
        }
    }
    if (!patient.tasks.empty() && !patient.has_passwords) {
        findings.push_back({"accounts", Severity::kWarning,
                            "whether the servers take the accounts and shares was not checked: " +
                                patient.no_passwords,
                            "run the doctor as root"});
    }
    const ServerQuestions questions(asked);
    size_t next = 0;  // index into `asked`, which is in the same order
    for (const PatientTask& task : patient.tasks) {
        const bool was_asked = next < asked.size() && asked[next] == &task;
        Findings found;
        if (was_asked) {
            CheckAnswer(questions.Answer(next), questions.Skipped(next), task, found);
            ++next;
        }
        CheckWatch(task, found);
        CheckLastRun(task, found);
        CheckVerification(task, found);
        CheckNote(task, found);
        if (found.empty()) {
            found.push_back({"", Severity::kOk, WellWords(task, was_asked), ""});
        }
        for (Finding& finding : found) {
            finding.name = "task " + task.record.GetInfo().GetName();
            findings.push_back(std::move(finding));
        }
    }
}

}  // namespace zelctl
