// Whether a file stands in the place of another one that rsync takes it for.
#pragma once

#include <string>
#include <utility>
#include <vector>

#include "programs/common/run_result.h"
#include "programs/zel_daemon/index_lookup.h"

namespace zel_daemon {

/// What the copy has, and has under another name until the server has made the moves of an order.
/// Every operation may throw as the index does, which outlives it and does not change meanwhile.
class KnownFiles {
public:
    KnownFiles(FileIndex& index, const std::vector<programs::ShareMove>& moves);

    /// Whether the copy has, or may have, another file in the place of this one, whose size and
    /// time are the same.
    bool IsDoubtful(const IndexEntry& file);

private:
    IndexLookup here_;
    IndexLookup before_;
    std::vector<std::pair<std::string, std::string>> moves_;  // keys, the last one first
};

}  // namespace zel_daemon
