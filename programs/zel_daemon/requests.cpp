#include "programs/zel_daemon/requests.h"

#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <initializer_list>
#include <iterator>
#include <set>
#include <utility>

#include "ZEL/channel.h"
#include "ZEL/log.h"
#include "programs/common/failure.h"
#include "programs/common/run_progress.h"
#include "programs/common/schedule_words.h"
#include "programs/common/seen_folder.h"
#include "programs/common/share_path.h"
#include "programs/common/task_fields.h"
#include "programs/common/task_row.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/store.h"

namespace zel_daemon {

namespace {

using ZEL::PObject;

constexpr unsigned int kProtocol = 1;
constexpr unsigned int kLogLimit = 20;

// Keys of a task that are the daemon's own: an exported task has them, and they are passed over.
const std::set<std::string>& StateKeys() {
    static const std::set<std::string> keys = [] {
        std::set<std::string> all = {"id",
                                     "row",
                                     "schedule",
                                     "status",
                                     "sync_result",
                                     "next_run",
                                     "retry_in",
                                     "pending",
                                     "note",
                                     "confirm",
                                     "run",
                                     "last_run",
                                     "last_start",
                                     "last_end",
                                     "last_compared",
                                     "bandwidth_now",
                                     "bandwidth_until",
                                     "last_verified",
                                     "verify_place",
                                     "verify_problem",
                                     "damaged",
                                     "damage",
                                     "last_status",
                                     "last_error",
                                     "watched_folders",
                                     "watch_searching",
                                     "watch_complete",
                                     "watch_problem"};
        all.insert(programs::ProgressKeys().begin(), programs::ProgressKeys().end());
        return all;
    }();
    return keys;
}

PObject Number(uint64_t value) {
    return PObject(static_cast<unsigned long long>(value));
}

PObject ErrorReply(int code, const std::string& text) {
    PObject reply;
    reply["result"] = code;
    reply["error"] = text;
    return reply;
}

PObject Success() {
    PObject reply;
    reply["result"] = 0;
    return reply;
}

[[noreturn]] void Refuse(const std::string& text) {
    throw RequestError(ZEL::RESULT_INVALID_ARGUMENT, text);
}

std::string TextOf(const PObject& request, const char* key) {
    if (!request[key].isString()) {
        Refuse(std::string("key ") + key + " is missing or no text");
    }
    return request[key].asString();
}

unsigned int NumberOf(const PObject& request, const char* key, unsigned int fallback,
                      unsigned int max) {
    if (!request.hasMember(key)) {
        return fallback;
    }
    if (!request[key].isInteger() || request[key].asUInt64() > max) {
        Refuse(std::string("key ") + key + " has to be a number up to " + std::to_string(max));
    }
    return request[key].asUInt32();
}

uint64_t BigNumberOf(const PObject& request, const char* key) {
    if (!request[key].isInteger()) {
        Refuse(std::string("key ") + key + " is missing or no number");
    }
    return request[key].asUInt64();
}

bool FlagOf(const PObject& request, const char* key) {
    return NumberOf(request, key, 0, 1) == 1;
}

// "2024/march" as runs have it: "/2024/march".
std::string PathOfRun(const std::string& text) {
    const auto path = programs::PathInShare(text);
    if (text.empty() || !path) {
        Refuse("'" + programs::Printable(text) + "' is no path of a share");
    }
    return "/" + *path;
}

// Of which part of a task a request wants to know; empty: of all.
std::vector<programs::ShareOrder> PartOf(const TaskRecord& record, const PObject& request) {
    const auto& shares = record.Info().GetShareList();
    const bool named = request.hasMember("share");
    std::vector<std::string> paths;
    if (request.hasMember("paths")) {
        for (const PObject& path : request["paths"].asArray()) {
            paths.push_back(PathOfRun(path.asString()));
        }
    }
    if (!named && paths.empty()) {
        return {};
    }
    if (!named && shares.size() > 1) {
        Refuse("the task has several shares: say whose paths are meant");
    }
    programs::ShareOrder part;
    part.share = named ? TextOf(request, "share") : shares.front();
    if (std::find(shares.begin(), shares.end(), part.share) == shares.end()) {
        Refuse("the task has no share '" + programs::Printable(part.share) + "'");
    }
    if (!paths.empty()) {
        part.paths = paths;
    }
    return {part};
}

// The task as a list shows it.
std::string RowOf(const TaskRecord& record, const TaskState& state) {
    const ZEL::TaskInfo& info = record.Info();
    const ZEL::SyncInfo& sync = info.GetSyncInfo();
    programs::TaskRow row;
    row.name = info.GetName();
    for (const std::string& share : info.GetShareList()) {
        row.shares += (row.shares.empty() ? "" : ",") + share;
    }
    row.server = sync.GetServerName().empty() ? sync.GetServerIP() : sync.GetServerName();
    row.schedule = programs::DescribeSchedule(info.GetSchedule());
    row.status = state.status;
    if (state.last != nullptr) {
        row.result = state.last->result;
        row.last_end = state.last->end;
        if (row.result == ZEL::TASK_RESULT_FAILED) {
            row.error = programs::OneLine(state.last->error);
        }
    }
    row.next_run = state.next_run;
    if (state.retry_in) {
        row.retry_in = static_cast<uint64_t>(*state.retry_in);
    }
    if (state.active != nullptr && !state.active->progress_share.empty()) {
        row.progress = programs::ProgressState(state.active->progress);
    }
    row.pending = state.pending;
    row.note = state.note;
    return programs::PackTaskRow(row);
}

}  // namespace

/// What a command is called, which keys it knows beside "command", and who answers it.
struct Requests::Command {
    const char* name;
    std::set<std::string> keys;
    bool takes_task;  // the keys of a task, too
    // What it does to tasks when only root and the daemon's own user may; null: members of the
    // group may, too.
    const char* owners_may;
    Answer (Requests::*answer)(const Peer&, const PObject&);
};

Requests::Requests(Service& service, std::function<std::string()> reload, std::string store_path)
    : service_(service),
      reload_(std::move(reload)),
      store_path_(std::move(store_path)),
      started_(time(nullptr)) {}

bool Requests::IsWatch(const PObject& request) {
    return request["command"].asString() == "watch";
}

bool Requests::Stays(const PObject& request) {
    const std::string& command = request["command"].asString();
    return command == "watch" || command == "task_preview" || command == "task_verify";
}

bool Requests::Configures(const PObject& request) {
    const std::string& command = request["command"].asString();
    return command == "task_add" || command == "task_edit" || command == "task_remove";
}

Answer Requests::Reply(const Peer& peer, const PObject& request) {
    try {
        return Dispatch(peer, request);
    } catch (const programs::Failure& failure) {
        if (failure.Status() != 0) {
            return ErrorReply(failure.Status(), failure.what());
        }
        // Not the request's, but the store's.
        ZEL::Logger::LogMsg(ZEL::Logger::LEVEL_ERROR, "[ERROR] zel_daemon(%d): %s\n", __LINE__,
                            failure.what());
        return ErrorReply(ZEL::RESULT_SYSTEM, failure.what());
    } catch (const std::exception& error) {
        return ErrorReply(ZEL::RESULT_SYSTEM, error.what());
    }
}

Answer Requests::Dispatch(const Peer& peer, const PObject& request) {
    static const std::set<std::string> add_keys = [] {
        std::set<std::string> keys = StateKeys();
        keys.insert("paused");
        return keys;
    }();
    static const Command commands[] = {
        {"task_add", add_keys, true, "add tasks", &Requests::TaskAdd},
        {"task_edit", {"task"}, true, "edit tasks", &Requests::TaskEdit},
        {"task_remove", {"task"}, false, "remove tasks", &Requests::TaskRemove},
        {"task_confirm",
         {"task"},
         false,
         "allow what a task asks, as files can be lost by it",
         &Requests::TaskConfirm},
        {"share_check",
         {"path", "device", "inode", "volume"},
         false,
         "ask what the daemon sees",
         &Requests::ShareCheck},
        {"reload", {}, false, "have the configuration read again", &Requests::Reload},
        // An export, and what shows passwords, is for the owners as well: see below.
        {"task_list", {"secrets", "export", "brief", "rows"}, false, nullptr, &Requests::TaskList},
        {"task_show", {"task", "secrets"}, false, nullptr, &Requests::TaskShow},
        {"task_run", {"task"}, false, nullptr, &Requests::TaskRun},
        {"task_preview", {"task"}, false, nullptr, &Requests::TaskPreview},
        {"task_verify", {"task", "share", "paths"}, false, nullptr, &Requests::TaskVerify},
        {"task_cancel", {"task"}, false, nullptr, &Requests::TaskCancel},
        {"task_pause", {"task"}, false, nullptr, &Requests::TaskPause},
        {"task_resume", {"task"}, false, nullptr, &Requests::TaskResume},
        {"task_log", {"task", "limit", "details"}, false, nullptr, &Requests::TaskLog},
        {"watch", {"task"}, false, nullptr, &Requests::Watch},
        {"daemon_status", {}, false, nullptr, &Requests::DaemonStatus},
    };
    const std::string name = TextOf(request, "command");
    const auto command = std::find_if(std::begin(commands), std::end(commands),
                                      [&](const Command& known) { return name == known.name; });
    if (command == std::end(commands)) {
        Refuse("there is no command '" + programs::Printable(name) + "'");
    }
    const char* const owners_may = command->owners_may != nullptr ? command->owners_may
                                   : FlagOf(request, "secrets")   ? "see passwords"
                                   : FlagOf(request, "export")    ? "export tasks"
                                                                  : nullptr;
    if (owners_may != nullptr && !peer.trusted) {
        throw RequestError(ZEL::RESULT_NO_PERMISSION,
                           std::string("only root and the daemon's own user may ") + owners_may +
                               "; members of its group may look at tasks, run, preview, pause, "
                               "resume and cancel them");
    }
    for (const auto& [key, value] : request.asMap()) {
        if (key != "command" && command->keys.count(key) == 0 &&
            !(command->takes_task && programs::FindTaskField(key) != nullptr)) {
            Refuse("command " + name + " has no key '" + programs::Printable(key) + "'");
        }
    }
    return (this->*command->answer)(peer, request);
}

Answer Requests::TaskAdd(const Peer&, const PObject& request) {
    TaskRecord record;
    record.paused = FlagOf(request, "paused");
    ApplyRequest(request, record, record.paused ? LookUp::kLater : LookUp::kNow);
    PObject reply = Success();
    reply["task"] = ShownTask(service_.Add(std::move(record)), TaskDetail::kAll);
    return reply;
}

Answer Requests::TaskEdit(const Peer&, const PObject& request) {
    const std::string name = TextOf(request, "task");
    const TaskRecord& before = service_.Find(name);
    TaskRecord record = before;
    ApplyRequest(request, record);
    PObject reply = Success();
    // Whoever has a task lead elsewhere does not get there the password that was given for here.
    if (!request.hasMember("pswd") && !before.Info().GetSyncInfo().GetPassword().empty() &&
        !programs::SameAccount(before.ToMap(), record.ToMap())) {
        PObject forgotten;
        forgotten["pswd"] = "";
        record.Apply(forgotten);
        reply["password_forgotten"] = 1;
    }
    const bool changed = !record.SameAs(before);
    reply["changed"] = changed;
    // What is so already does not begin anew.
    reply["task"] =
        ShownTask(changed ? service_.Edit(name, std::move(record)) : before, TaskDetail::kAll);
    return reply;
}

Answer Requests::TaskList(const Peer&, const PObject& request) {
    const bool secrets = FlagOf(request, "secrets");
    const bool brief = FlagOf(request, "brief");
    PObject reply = Success();
    if (FlagOf(request, "rows")) {
        for (const TaskRecord* record : service_.Tasks()) {
            reply["rows"].asArray().emplace_back(RowOf(*record, service_.StateOf(*record)));
        }
        reply["rows"].asArray();  // also without tasks
        return reply;
    }
    PObject::Array& tasks = reply["tasks"].asArray();
    for (const TaskRecord* record : service_.Tasks()) {
        tasks.push_back(ShownTask(*record, brief     ? TaskDetail::kBrief
                                           : secrets ? TaskDetail::kWithSecrets
                                                     : TaskDetail::kAll));
    }
    return reply;
}

Answer Requests::TaskShow(const Peer&, const PObject& request) {
    const bool secrets = FlagOf(request, "secrets");
    PObject reply = Success();
    const TaskRecord& record = service_.Find(TextOf(request, "task"));
    reply["task"] = ShownTask(record, secrets ? TaskDetail::kWithSecrets : TaskDetail::kAll);
    if (const programs::Bandwidth limits = record.Limits(); limits.Changes()) {
        const int64_t now = time(nullptr);
        reply["task"]["bandwidth_now"] = limits.At(now);
        if (const auto until = limits.Until(now)) {
            reply["task"]["bandwidth_until"] = Number(static_cast<uint64_t>(*until));
        }
    }
    const TaskState state = service_.StateOf(record);
    for (const auto& [share, question] : *state.asking) {
        reply["task"]["confirm"].asArray().push_back(QuestionToMap(share, question));
    }
    for (const auto& [name, share] : state.verified->All()) {
        for (const auto& [path, length] : share.damaged) {
            PObject file;
            file["share"] = name;
            file["path"] = path;
            file["length"] = Number(length);
            reply["task"]["damage"].asArray().push_back(std::move(file));
        }
    }
    return reply;
}

Answer Requests::TaskRemove(const Peer&, const PObject& request) {
    service_.Remove(TextOf(request, "task"));
    return Success();
}

Answer Requests::TaskRun(const Peer&, const PObject& request) {
    PObject reply = Success();
    reply["after"] = Number(service_.RequestRun(TextOf(request, "task")));
    return reply;
}

Answer Requests::TaskPreview(const Peer&, const PObject& request) {
    PObject reply = Success();
    reply["waiting"] = 1;
    return {std::move(reply), service_.Preview(TextOf(request, "task"))};
}

Answer Requests::TaskVerify(const Peer&, const PObject& request) {
    PObject reply = Success();
    reply["waiting"] = 1;
    const std::string name = TextOf(request, "task");
    return {std::move(reply), service_.Preview(name, PartOf(service_.Find(name), request))};
}

Answer Requests::TaskConfirm(const Peer&, const PObject& request) {
    PObject reply = Success();
    reply["after"] = Number(service_.Confirm(TextOf(request, "task")));
    return reply;
}

Answer Requests::TaskCancel(const Peer&, const PObject& request) {
    service_.Cancel(TextOf(request, "task"));
    return Success();
}

Answer Requests::TaskPause(const Peer&, const PObject& request) {
    service_.SetPaused(TextOf(request, "task"), true);
    return Success();
}

Answer Requests::TaskResume(const Peer&, const PObject& request) {
    service_.SetPaused(TextOf(request, "task"), false);
    return Success();
}

Answer Requests::TaskLog(const Peer&, const PObject& request) {
    const unsigned int limit = NumberOf(request, "limit", kLogLimit, Store::kRunsKept);
    PObject reply = Success();
    PObject::Array& runs = reply["runs"].asArray();
    const bool details = FlagOf(request, "details");
    for (const RunRecord& run : service_.Runs(TextOf(request, "task"), limit)) {
        runs.push_back(RunToMap(run, details));
    }
    return reply;
}

Answer Requests::ShareCheck(const Peer&, const PObject& request) {
    programs::SeenFolder seen;
    seen.device = BigNumberOf(request, "device");
    seen.inode = BigNumberOf(request, "inode");
    seen.volume = TextOf(request, "volume");
    PObject reply = Success();
    const std::string problem = programs::DifferenceFrom(seen, TextOf(request, "path"));
    if (!problem.empty()) {
        reply["problem"] = problem;
    }
    return reply;
}

Answer Requests::Watch(const Peer&, const PObject& request) {
    PObject reply = Success();
    PObject::Array& tasks = reply["tasks"].asArray();
    if (request.hasMember("task")) {
        tasks.push_back(ShownTask(service_.Find(TextOf(request, "task")), TaskDetail::kBrief));
        return reply;
    }
    for (const TaskRecord* record : service_.Tasks()) {
        tasks.push_back(ShownTask(*record, TaskDetail::kBrief));
    }
    return reply;
}

Answer Requests::DaemonStatus(const Peer&, const PObject&) {
    const ServiceStats stats = service_.Stats();
    PObject reply = Success();
    reply["version"] = ZEL_VERSION;
    reply["protocol"] = kProtocol;
    reply["pid"] = Number(static_cast<uint64_t>(getpid()));
    reply["started"] = Number(static_cast<uint64_t>(started_));
    reply["tasks"] = Number(stats.tasks);
    reply["running"] = Number(stats.running);
    reply["workers"] = stats.workers;
    reply["damaged"] = Number(stats.damaged);
    reply["folders"] = Number(stats.watched.folders);
    reply["searching"] = stats.watched.scanning;
    reply["store"] = store_path_;
    return reply;
}

Answer Requests::Reload(const Peer&, const PObject&) {
    const std::string problem = reload_();
    if (!problem.empty()) {
        Refuse(problem);
    }
    return Success();
}

PObject Requests::ShownTask(const TaskRecord& record, TaskDetail detail) const {
    PObject map = TaskToMap(record, detail);
    AddState(record, map);
    return map;
}

void Requests::AddState(const TaskRecord& record, PObject& map) const {
    const TaskState state = service_.StateOf(record);
    map["row"] = RowOf(record, state);
    map["schedule"] = programs::DescribeSchedule(record.Info().GetSchedule());
    map["status"] = static_cast<int>(state.status);
    map["sync_result"] =
        static_cast<int>(state.last != nullptr ? state.last->result : ZEL::TASK_RESULT_NONE);
    map["pending"] = Number(state.pending);
    if (state.watch) {
        map["watched_folders"] = Number(state.watch->folders);
        map["watch_searching"] = state.watch->scanning;
        map["watch_complete"] = state.watch->complete;
        if (!state.watch->problem.empty()) {
            map["watch_problem"] = state.watch->problem;
        }
    }
    if (state.next_run) {
        map["next_run"] = Number(static_cast<uint64_t>(*state.next_run));
    }
    if (state.retry_in) {
        map["retry_in"] = Number(static_cast<uint64_t>(*state.retry_in));
    }
    if (!state.note.empty()) {
        map["note"] = state.note;
    }
    if (record.compared != 0) {
        map["last_compared"] = Number(static_cast<uint64_t>(record.compared));
    }
    if (const auto verified = state.verified->LastVerified()) {
        map["last_verified"] = Number(static_cast<uint64_t>(*verified));
    }
    for (const auto& [name, share] : state.verified->All()) {
        if (share.round.goes_on) {
            map["verify_place"] = name + ": " + share.round.place;
        }
    }
    if (!state.verify_problem.empty()) {
        map["verify_problem"] = state.verify_problem;
    }
    if (const size_t damaged = state.verified->Damaged()) {
        map["damaged"] = Number(damaged);
    }
    if (state.last != nullptr) {
        map["last_run"] = Number(state.last->id);
        map["last_start"] = Number(static_cast<uint64_t>(state.last->start));
        map["last_end"] = Number(static_cast<uint64_t>(state.last->end));
        map["last_status"] = state.last->status;
        map["last_error"] = state.last->error;
    }
    if (state.active == nullptr) {
        return;
    }
    map["run"] = Number(state.run);
    if (!state.active->progress_share.empty()) {
        programs::AddProgress(state.active->progress_share, state.active->progress, map);
    }
}

}  // namespace zel_daemon
