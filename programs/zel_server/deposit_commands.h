// The commands with which a client leaves its configuration, and gets it back.
#pragma once

#include "programs/zel_server/answers.h"
#include "programs/zel_server/request.h"

namespace zel_server {

/// Takes a piece of a client's configuration. Called with the registry's lock held.
Answer DepositConfig(const Request& request);
/// Lists what the account's clients have deposited.
Answer ListDeposits(const Request& request);
/// Gives one of these back.
Answer FetchDeposit(const Request& request);

}  // namespace zel_server
