// Single entries of an index, fast where their keys are near each other.
#pragma once

#include <algorithm>
#include <optional>
#include <string>
#include <vector>

#include "programs/zel_daemon/file_index.h"

namespace zel_daemon {

/// Every operation may throw as the index does, which outlives it and does not change meanwhile.
class IndexLookup {
public:
    explicit IndexLookup(FileIndex& index) : index_(index) {}

    /// Null: there is none. Valid until the next call.
    const EntryFacts* Find(const std::string& key) {
        if (!Covers(key)) {
            chunk_ = index_.Around(key);
            has_limit_ = false;
        }
        const auto found = std::lower_bound(
            chunk_.begin(), chunk_.end(), key,
            [](const IndexEntry& entry, const std::string& wanted) { return entry.key < wanted; });
        return found != chunk_.end() && found->key == key ? &found->facts : nullptr;
    }

private:
    bool Covers(const std::string& key) {
        if (chunk_.empty() || key < chunk_.front().key || key <= chunk_.back().key) {
            return !chunk_.empty() && key >= chunk_.front().key;
        }
        if (!has_limit_) {
            limit_ = index_.ChunkAfter(chunk_.back().key);
            has_limit_ = true;
        }
        return !limit_ || key < *limit_;
    }

    FileIndex& index_;
    std::vector<IndexEntry> chunk_;
    bool has_limit_ = false;
    std::optional<std::string> limit_;  // where the next chunk begins; nothing: there is none
};

}  // namespace zel_daemon
