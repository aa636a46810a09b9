// Entries of an index in few bytes: some 20 and what is new in the name.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "programs/zel_daemon/entry_facts.h"

namespace zel_daemon {

struct IndexEntry {
    std::string key;  ///< see path_key.h
    EntryFacts facts;
};

/// Puts entries together. Their order is that of their keys; one that says little more than the one
/// before it takes little room: of its key, how much of the end of that one's goes, and what comes
/// instead. So the bytes are the same wherever a folder lies that all the entries are in.
class ChunkWriter {
public:
    /// The first key is `first`, which is known to who will read it. Before any entry.
    void Begin(std::string_view first) { last_.key = first; }
    void Add(std::string_view key, const EntryFacts& facts);
    const std::string& Bytes() const { return bytes_; }
    bool Empty() const { return bytes_.empty(); }
    /// What has been put together; it begins anew.
    std::string Take();

private:
    void Number(uint64_t value);
    void Difference(uint64_t value, uint64_t from);

    std::string bytes_;
    IndexEntry last_;
};

/// Takes them apart again.
class ChunkReader {
public:
    ChunkReader() = default;
    /// `bytes` outlive it. `first`: see ChunkWriter::Begin().
    explicit ChunkReader(std::string_view bytes, std::string_view first = {}) : bytes_(bytes) {
        last_.key = first;
    }
    /// False: there is no other. Throws Failure when the bytes are none of a ChunkWriter's.
    bool Next(IndexEntry& entry);

private:
    uint64_t Number();
    uint64_t Sum(uint64_t from);

    std::string_view bytes_;
    IndexEntry last_;
};

}  // namespace zel_daemon
