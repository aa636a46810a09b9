// Whether a client and account may start or continue to push into a share. A pairing asks this in
// advance, and the start of a push asks it again.
#pragma once

#include <string>
#include <vector>

namespace zel_server {

/// Maximum number of shares of one account.
inline constexpr size_t kMaxAccountShares = 256;

struct Refusal {
    int status = 0;                   ///< kDone: nothing is refused
    std::vector<std::string> shares;  ///< the refused ones
};

/// Which of `shares` are refused, and why. The status is kConflicts also when they are refused for
/// different reasons. A failure that concerns no share in particular, such as kRegistryRead, lists
/// none.
Refusal RefusalOf(const std::vector<std::string>& shares, const std::string& client,
                  const std::string& account);

}  // namespace zel_server
