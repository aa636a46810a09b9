// The entries of an index, one after the other.
#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "programs/zel_daemon/file_index.h"
#include "programs/zel_daemon/path_key.h"

namespace zel_daemon {

/// Reads some entries at a time. Every operation may throw as the index does, which outlives it.
class IndexWalk {
public:
    /// Begins with the first entry of all.
    explicit IndexWalk(FileIndex& index) : index_(index) { Read({}); }
    /// Begins with the first entry after `key`.
    IndexWalk(FileIndex& index, const std::string& key) : index_(index) {
        chunk_ = index_.Around(key);
        if (chunk_.empty()) {
            Read({});
        }
        while (Entry() != nullptr && Entry()->key <= key) {
            Next();
        }
    }

    /// Null at the end.
    const IndexEntry* Entry() const { return at_ < chunk_.size() ? &chunk_[at_] : nullptr; }
    void Next() {
        if (++at_ == chunk_.size()) {
            Read(chunk_.back().key);
        }
    }
    void SkipBelow(const std::string& key) {
        while (Entry() != nullptr && IsWithin(Entry()->key, key)) {
            Next();
        }
    }

private:
    void Read(const std::optional<std::string>& after) {
        chunk_ = index_.After(after);
        at_ = 0;
    }

    FileIndex& index_;
    std::vector<IndexEntry> chunk_;
    size_t at_ = 0;
};

}  // namespace zel_daemon
