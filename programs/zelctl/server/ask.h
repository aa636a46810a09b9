// Asking a server what a push would ask it first.
#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "programs/common/task_run.h"

namespace zelctl {

/// Why the server does not take the shares from this client and account; none when it does. Changes
/// nothing there. One that does not answer within `patience` has failed. Any thread.
std::optional<programs::RunFailure> AskServer(const ZEL::SyncInfo& info,
                                              const std::vector<std::string>& shares,
                                              std::chrono::seconds patience);

/// Whether that was the end of the patience.
bool IsSilence(const programs::RunFailure& failure);

/// Whether no later push would fare better: the account, or the shares' owner, has to be another
/// one, or it is no server of ours.
bool IsRefusedForGood(const programs::RunFailure& failure);

}  // namespace zelctl
