// Tasks as the maps that travel between the daemon and who asks it; docs/daemon-protocol.md has the
// keys.
#pragma once

#include <string>

#include "programs/common/failure.h"
#include "programs/zel_daemon/task_record.h"

namespace zel_daemon {

/// A request that cannot be fulfilled: the ZEL::ResultCode and the words for its reply.
inline programs::Failure RequestError(int result, const std::string& text) {
    return {programs::FailureKind::kUsage, text, result};
}

/// Whether the shares of a task have to be there now, or when it runs.
enum class LookUp { kNow, kLater };

/// Changes the settings of `record` that `request` names; keys that are none of a task's are left
/// to the caller. Throws Failure (-4) for a value that does not pass and for a task that would not;
/// `record` is then as it was. Shares are looked up on this host when the request names them
/// (RequestError, -17, for one that cannot be pushed from here).
void ApplyRequest(const ZEL::PObject& request, TaskRecord& record, LookUp shares = LookUp::kNow);

enum class TaskDetail { kBrief, kAll, kWithSecrets };

/// The task's own keys: those that a list shows, all, or with what only a few may see.
ZEL::PObject TaskToMap(const TaskRecord& record, TaskDetail detail);

/// One run of the history.
ZEL::PObject RunToMap(const RunRecord& run, bool with_details);
/// What a person is asked about a share, as in docs/daemon-protocol.md.
ZEL::PObject QuestionToMap(const std::string& share, const programs::Question& question);

}  // namespace zel_daemon
