#include "programs/zel_daemon/requests.h"

#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <initializer_list>
#include <iterator>
#include <set>

#include "ZEL/channel.h"
#include "ZEL/log.h"
#include "programs/common/failure.h"
#include "programs/common/run_progress.h"
#include "programs/common/schedule_words.h"
#include "programs/common/seen_folder.h"
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
                                     "run",
                                     "last_run",
                                     "last_start",
                                     "last_end",
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

bool AsksForSecrets(const Peer& peer, const PObject& request) {
    const bool secrets = FlagOf(request, "secrets");
    if (secrets && !peer.trusted) {
        throw RequestError(ZEL::RESULT_NO_PERMISSION,
                           "only root and the daemon's own user may see passwords");
    }
    return secrets;
}

}  // namespace

/// What a command is called, which keys it knows beside "command", and who answers it.
struct Requests::Command {
    const char* name;
    std::set<std::string> keys;
    bool takes_task;  // the keys of a task, too
    PObject (Requests::*answer)(const Peer&, const PObject&);
};

Requests::Requests(Service& service, std::function<std::string()> reload, std::string store_path)
    : service_(service),
      reload_(std::move(reload)),
      store_path_(std::move(store_path)),
      started_(time(nullptr)) {}

bool Requests::IsWatch(const PObject& request) {
    return request["command"].asString() == "watch";
}

PObject Requests::Answer(const Peer& peer, const PObject& request) {
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

PObject Requests::Dispatch(const Peer& peer, const PObject& request) {
    static const Command commands[] = {
        {"task_add", StateKeys(), true, &Requests::TaskAdd},
        {"task_edit", {"task"}, true, &Requests::TaskEdit},
        {"task_list", {"secrets", "brief", "rows"}, false, &Requests::TaskList},
        {"task_show", {"task", "secrets"}, false, &Requests::TaskShow},
        {"task_remove", {"task"}, false, &Requests::TaskRemove},
        {"task_run", {"task"}, false, &Requests::TaskRun},
        {"task_cancel", {"task"}, false, &Requests::TaskCancel},
        {"task_pause", {"task"}, false, &Requests::TaskPause},
        {"task_resume", {"task"}, false, &Requests::TaskResume},
        {"task_log", {"task", "limit", "details"}, false, &Requests::TaskLog},
        {"share_check", {"path", "device", "inode", "volume"}, false, &Requests::ShareCheck},
        {"watch", {"task"}, false, &Requests::Watch},
        {"daemon_status", {}, false, &Requests::DaemonStatus},
        {"reload", {}, false, &Requests::Reload},
    };
    const std::string name = TextOf(request, "command");
    const auto command = std::find_if(std::begin(commands), std::end(commands),
                                      [&](const Command& known) { return name == known.name; });
    if (command == std::end(commands)) {
        Refuse("there is no command '" + programs::Printable(name) + "'");
    }
    for (const auto& [key, value] : request.asMap()) {
        if (key != "command" && command->keys.count(key) == 0 &&
            !(command->takes_task && programs::FindTaskField(key) != nullptr)) {
            Refuse("command " + name + " has no key '" + programs::Printable(key) + "'");
        }
    }
    return (this->*command->answer)(peer, request);
}

PObject Requests::TaskAdd(const Peer&, const PObject& request) {
    TaskRecord record;
    ApplyRequest(request, record);
    PObject reply = Success();
    reply["task"] = ShownTask(service_.Add(std::move(record)), TaskDetail::kAll);
    return reply;
}

PObject Requests::TaskEdit(const Peer&, const PObject& request) {
    const std::string name = TextOf(request, "task");
    const TaskRecord& before = service_.Find(name);
    TaskRecord record = before;
    ApplyRequest(request, record);
    const bool changed = !record.SameAs(before);
    PObject reply = Success();
    reply["changed"] = changed;
    // What is so already does not begin anew.
    reply["task"] =
        ShownTask(changed ? service_.Edit(name, std::move(record)) : before, TaskDetail::kAll);
    return reply;
}

PObject Requests::TaskList(const Peer& peer, const PObject& request) {
    const bool secrets = AsksForSecrets(peer, request);
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

PObject Requests::TaskShow(const Peer& peer, const PObject& request) {
    const bool secrets = AsksForSecrets(peer, request);
    PObject reply = Success();
    reply["task"] = ShownTask(service_.Find(TextOf(request, "task")),
                              secrets ? TaskDetail::kWithSecrets : TaskDetail::kAll);
    return reply;
}

PObject Requests::TaskRemove(const Peer&, const PObject& request) {
    service_.Remove(TextOf(request, "task"));
    return Success();
}

PObject Requests::TaskRun(const Peer&, const PObject& request) {
    PObject reply = Success();
    reply["after"] = Number(service_.RequestRun(TextOf(request, "task")));
    return reply;
}

PObject Requests::TaskCancel(const Peer&, const PObject& request) {
    service_.Cancel(TextOf(request, "task"));
    return Success();
}

PObject Requests::TaskPause(const Peer&, const PObject& request) {
    service_.SetPaused(TextOf(request, "task"), true);
    return Success();
}

PObject Requests::TaskResume(const Peer&, const PObject& request) {
    service_.SetPaused(TextOf(request, "task"), false);
    return Success();
}

PObject Requests::TaskLog(const Peer&, const PObject& request) {
    const unsigned int limit = NumberOf(request, "limit", kLogLimit, Store::kRunsKept);
    PObject reply = Success();
    PObject::Array& runs = reply["runs"].asArray();
    const bool details = FlagOf(request, "details");
    for (const RunRecord& run : service_.Runs(TextOf(request, "task"), limit)) {
        runs.push_back(RunToMap(run, details));
    }
    return reply;
}

PObject Requests::ShareCheck(const Peer& peer, const PObject& request) {
    if (!peer.trusted) {
        throw RequestError(ZEL::RESULT_NO_PERMISSION,
                           "only root and the daemon's own user may ask what the daemon sees");
    }
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

PObject Requests::Watch(const Peer&, const PObject& request) {
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

PObject Requests::DaemonStatus(const Peer&, const PObject&) {
    const ServiceStats stats = service_.Stats();
    PObject reply = Success();
    reply["version"] = ZEL_VERSION;
    reply["protocol"] = kProtocol;
    reply["pid"] = Number(static_cast<uint64_t>(getpid()));
    reply["started"] = Number(static_cast<uint64_t>(started_));
    reply["tasks"] = Number(stats.tasks);
    reply["running"] = Number(stats.running);
    reply["workers"] = stats.workers;
    reply["folders"] = Number(stats.watched.folders);
    reply["searching"] = stats.watched.scanning;
    reply["store"] = store_path_;
    return reply;
}

PObject Requests::Reload(const Peer&, const PObject&) {
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
