// Asks a server in advance what a push would ask it.
#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "programs/common/task_run.h"

namespace zelctl {

/// Why the server does not accept the shares from this client and account; nothing when it does.
/// Changes nothing there. No answer within `patience` is a failure. Can be called from any thread.
std::optional<programs::RunFailure> AskServer(const ZEL::SyncInfo& info,
                                              const std::vector<std::string>& shares,
                                              std::chrono::seconds patience);

/// Whether the failure is such a time-out.
bool IsSilence(const programs::RunFailure& failure);

/// Whether a retry is pointless: the account or the owner of the shares would have to be different,
/// or the server is not one of this service.
bool IsRefusedForGood(const programs::RunFailure& failure);

}  // namespace zelctl
