// Single entries of an index, fast where one is asked for after those that come before it.
#pragma once

#include <optional>
#include <string>

#include "programs/zel_daemon/file_index.h"

namespace zel_daemon {

/// Every operation may throw as the index does, which outlives it and does not change meanwhile.
class IndexLookup {
public:
    explicit IndexLookup(FileIndex& index) : index_(index) {}
    IndexLookup(const IndexLookup&) = delete;
    IndexLookup& operator=(const IndexLookup&) = delete;

    /// Null: there is none. Valid until the next call.
    const EntryFacts* Find(const std::string& key) {
        if (!Covers(key)) {
            chunk_ = index_.ChunkAround(key);
            knows_next_ = false;
            Begin();
        } else if (key < entry_.key || (!has_entry_ && key == entry_.key)) {
            Begin();
        }
        while (has_entry_ && entry_.key < key) {
            has_entry_ = reader_.Next(entry_);
        }
        return has_entry_ && entry_.key == key ? &entry_.facts : nullptr;
    }

private:
    bool Covers(const std::string& key) {
        if (chunk_.bytes.empty() || key < chunk_.first) {
            return false;
        }
        if (has_entry_ && key <= entry_.key) {
            return true;
        }
        if (!knows_next_) {
            next_ = index_.ChunkAfter(chunk_.first);
            knows_next_ = true;
        }
        return !next_ || key < *next_;
    }

    void Begin() {
        reader_ = ChunkReader(chunk_.bytes, chunk_.first);
        has_entry_ = reader_.Next(entry_);
    }

    FileIndex& index_;
    IndexChunk chunk_;
    ChunkReader reader_;
    bool has_entry_ = false;
    IndexEntry entry_;  // the reader's last, also at the end
    bool knows_next_ = false;
    std::optional<std::string> next_;  // where the next chunk begins; nothing: there is none
};

}  // namespace zel_daemon
