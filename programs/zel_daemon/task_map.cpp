#include "programs/zel_daemon/task_map.h"

#include <utility>

#include "ZEL/channel.h"
#include "programs/common/task_fields.h"
#include "programs/zel_daemon/shortage.h"

namespace zel_daemon {

using ZEL::PObject;

void ApplyRequest(const PObject& request, TaskRecord& record, LookUp shares) {
    TaskRecord changed = record;
    changed.Apply(request);
    // The last look, because it asks the disk: a task whose volume is away can still be edited.
    for (const std::string& share : programs::TextsOf(request["share_list"])) {
        const std::string problem = shares == LookUp::kNow ? ShareProblem(share) : "";
        if (!problem.empty()) {
            throw RequestError(ZEL::RESULT_FOLDER_MISSING, problem);
        }
    }
    // Other copies, or more of them, have not been compared yet.
    if (changed.Info().GetShareList() != record.Info().GetShareList() ||
        !programs::SameAccount(record.ToMap(), changed.ToMap())) {
        changed.compared = 0;
    }
    record = std::move(changed);
}

PObject TaskToMap(const TaskRecord& record, TaskDetail detail) {
    PObject map = record.ToMap();
    for (const programs::TaskField& field : programs::TaskFields()) {
        if ((detail == TaskDetail::kBrief && !field.listed) ||
            (detail != TaskDetail::kWithSecrets && field.secret)) {
            map.asMap().erase(field.key);
        }
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

PObject QuestionToMap(const std::string& share, const programs::Question& question) {
    PObject map;
    map["share"] = share;
    map["reason"] = question.reason;
    map["text"] = question.text;
    map["amount"] = static_cast<unsigned long long>(question.amount);
    map["list"].asArray().assign(question.list.begin(), question.list.end());
    return map;
}

}  // namespace zel_daemon
