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

/// Sets the fields of `record` whose keys `request` has. Keys that are none of a task's are left to
/// the caller. Throws RequestError (-4) for a value of the wrong kind or size, and for a task that
/// would not pass; `record` is then as it was. Shares are looked up on this host when the request
/// names them (-17 for one that cannot be pushed from here).
void ApplyTaskKeys(const ZEL::PObject& request, TaskRecord& record);

/// Whether `key` is one that ApplyTaskKeys() takes.
bool IsTaskKey(const std::string& key);

/// The task's own keys; the password only with `secrets`.
ZEL::PObject TaskToMap(const TaskRecord& record, bool secrets);
/// Those of them that a list shows.
ZEL::PObject TaskToBriefMap(const TaskRecord& record);

/// One run of the history.
ZEL::PObject RunToMap(const RunRecord& run, bool with_details);

}  // namespace zel_daemon
