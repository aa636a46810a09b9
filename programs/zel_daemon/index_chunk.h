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
/// before it takes little room.
class ChunkWriter {
public:
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
    /// `bytes` outlive it.
    explicit ChunkReader(std::string_view bytes) : bytes_(bytes) {}
    /// False: there is no other. Throws Failure when the bytes are none of a ChunkWriter's.
    bool Next(IndexEntry& entry);

private:
    uint64_t Number();
    uint64_t Sum(uint64_t from);

    std::string_view bytes_;
    IndexEntry last_;
};

}  // namespace zel_daemon
