// Whether a file stands in the place of another one that rsync takes it for.
#pragma once

#include <cstddef>
#include <string>
#include <unordered_map>
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
    bool TakeBack(std::string& key, size_t& count) const;

    IndexLookup here_;
    IndexLookup before_;
    // Of all moves, in their order, the key of where it began; and by the key of where it went,
    // which these are.
    std::vector<std::string> froms_;
    std::unordered_map<std::string, std::vector<size_t>> by_place_;
};

}  // namespace zel_daemon
