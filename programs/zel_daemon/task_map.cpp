#include "programs/zel_daemon/task_map.h"

#include <algorithm>
#include <cstdint>
#include <set>

#include "ZEL/channel.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/shortage.h"

namespace zel_daemon {

namespace {

using ZEL::PObject;

constexpr char kExclude[] = "exclude";
constexpr char kShares[] = "share_list";

[[noreturn]] void Refuse(const std::string& text) {
    throw RequestError(ZEL::RESULT_INVALID_ARGUMENT, text);
}

std::string Shown(const std::string& text) {
    return "'" + programs::Printable(text) + "'";
}

// Every key of a task with a value of its kind: what the library writes of a task is what it takes.
const PObject& Pattern() {
    static const PObject pattern = [] {
        PObject map;
        ZEL::TaskInfo2PObj(ZEL::TaskInfo(), map);
        map[kExclude].asArray();
        return map;
    }();
    return pattern;
}

const char* KindOf(const PObject& value) {
    return value.isInteger() ? "a number" : value.isString() ? "a text" : "an array of texts";
}

void CheckKind(const std::string& key, const PObject& value) {
    const PObject& wanted = Pattern()[key];
    bool fits = wanted.isInteger()  ? value.isInteger()
                : wanted.isString() ? value.isString()
                                    : value.isArray();
    if (value.isArray()) {
        const PObject::Array& items = value.asArray();
        fits = fits && std::all_of(items.begin(), items.end(),
                                   [](const PObject& item) { return item.isString(); });
    }
    if (!fits) {
        Refuse("key " + key + " has to be " + KindOf(wanted));
    }
    if (value.isInteger() && value.asUInt64() > INT32_MAX) {
        Refuse("key " + key + ": " + std::to_string(value.asUInt64()) + " is too large");
    }
}

void CheckName(const std::string& name) {
    if (!programs::IsTaskName(name)) {
        Refuse(
            "a task's name has 1 to 128 bytes, without control characters, quotes and brackets: " +
            Shown(name));
    }
}

void CheckSyncInfo(const ZEL::SyncInfo& info) {
    if (info.GetServerIP().empty() && info.GetServerName().empty()) {
        Refuse("neither server_name nor server_ip is given");
    }
    if (info.GetUser().empty()) {
        Refuse("user, the account at the server, is not given");
    }
    if (!info.Validate()) {
        Refuse("ssh_port has to be below 65536 and rsync_timeout from 600 to 86400 seconds");
    }
}

void CheckShares(const std::list<std::string>& shares) {
    if (shares.empty()) {
        Refuse("share_list names no share");
    }
    if (std::set<std::string>(shares.begin(), shares.end()).size() != shares.size()) {
        Refuse("share_list names a share twice");
    }
    for (const std::string& share : shares) {
        const std::string problem = ShareProblem(share);
        if (!problem.empty()) {
            throw RequestError(ZEL::RESULT_FOLDER_MISSING, problem);
        }
    }
}

void CheckExcludes(const std::vector<std::string>& patterns) {
    for (const std::string& pattern : patterns) {
        if (pattern.empty() || pattern.find('\n') != std::string::npos) {
            Refuse("an exclude pattern is empty or has a line break: " + Shown(pattern));
        }
    }
}

}  // namespace

bool IsTaskKey(const std::string& key) {
    return Pattern().hasMember(key);
}

void ApplyTaskKeys(const PObject& request, TaskRecord& record) {
    PObject map;
    ZEL::SyncTask2PObj(record.task, map);
    for (const auto& [key, value] : request.asMap()) {
        if (IsTaskKey(key)) {
            CheckKind(key, value);
            map[key] = value;
        }
    }
    TaskRecord changed = record;
    ZEL::PObj2SyncTask(map, changed.task);
    if (request.hasMember(kExclude)) {
        changed.excludes.clear();
        for (const PObject& pattern : request[kExclude].asArray()) {
            changed.excludes.push_back(pattern.asString());
        }
    }
    CheckName(changed.Name());
    CheckSyncInfo(changed.Info().GetSyncInfo());
    if (!changed.Info().GetSchedule().Validate()) {
        Refuse(
            "the schedule does not pass: the start is a time of day, the begin a date since 1970, "
            "the runs of a day end before midnight, and there are at most 95 repeats");
    }
    CheckExcludes(changed.excludes);
    // The last look, because it asks the disk: a task whose volume is away can still be edited.
    if (request.hasMember(kShares)) {
        CheckShares(changed.Info().GetShareList());
    }
    record = std::move(changed);
}

PObject TaskToMap(const TaskRecord& record, bool secrets) {
    PObject map;
    ZEL::SyncTask2PObj(record.task, map);
    if (!secrets) {
        map.asMap().erase("pswd");
    }
    PObject::Array& excludes = map[kExclude].asArray();
    for (const std::string& pattern : record.excludes) {
        excludes.emplace_back(pattern);
    }
    return map;
}

PObject TaskToBriefMap(const TaskRecord& record) {
    const ZEL::SyncInfo& info = record.Info().GetSyncInfo();
    PObject map;
    map["id"] = static_cast<unsigned long long>(record.ID());
    map["name"] = record.Name();
    map["user"] = info.GetUser();
    map["server_ip"] = info.GetServerIP();
    map["server_name"] = info.GetServerName();
    map["schedule_mode"] = static_cast<int>(record.Info().GetSchedule().GetMode());
    PObject::Array& shares = map[kShares].asArray();
    for (const std::string& share : record.Info().GetShareList()) {
        shares.emplace_back(share);
    }
    return map;
}

PObject RunToMap(const RunRecord& run, bool with_details) {
    static const char* const reasons[] = {"schedule", "change", "request", "retry"};
    PObject map;
    map["run"] = static_cast<unsigned long long>(run.id);
    map["start"] = static_cast<unsigned long long>(run.start);
    if (run.end != 0) {
        map["end"] = static_cast<unsigned long long>(run.end);
    }
    map["sync_result"] = static_cast<int>(run.result);
    map["sync_status"] = run.status;
    map["error"] = run.error;
    if (with_details && !run.details.empty()) {
        map["details"] = run.details;
    }
    map["reason"] = reasons[static_cast<int>(run.reason)];
    map["files_sent"] = static_cast<unsigned long long>(run.files_sent);
    map["files_deleted"] = static_cast<unsigned long long>(run.files_deleted);
    map["bytes_sent"] = static_cast<unsigned long long>(run.bytes_sent);
    map["rsync_runs"] = static_cast<unsigned long long>(run.rsync_runs);
    return map;
}

}  // namespace zel_daemon
