// The entries of a share as its copy has them: what was so here before they were last sent.
//
// One SQLite file for each share of a task, beside the store. It is a note and no more: whatever it
// has lost costs a comparison. Names that come one after the other are kept together in chunks, so
// that a file takes some 20 bytes; a change writes one chunk anew. A chunk does not say where it
// is: a large folder is moved by the keys of its chunks alone.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "programs/zel_daemon/index_chunk.h"
#include "programs/zel_daemon/index_stamp.h"
#include "programs/zel_daemon/sqlite.h"

namespace zel_daemon {

/// What a run's end brings into an index, noted before the run begins: some 40 bytes for an entry.
class IndexChanges {
public:
    /// What the index has at the key and below it is void; what there is follows. Keys come in
    /// their order.
    void Replace(std::string_view key);
    /// Before all others: what the index has at `from` and below it is at `to` now, and nothing
    /// else. REQUIRES that none of both is within the other.
    void Move(const std::string& from, const std::string& to) { moves_.emplace_back(from, to); }
    /// An entry is so: one of these, or a folder above what is replaced.
    void Put(std::string_view key, const EntryFacts& facts) { writer_.Add(key, facts); }

    size_t Bytes() const { return writer_.Bytes().size(); }

private:
    friend class FileIndex;
    std::vector<std::pair<std::string, std::string>> moves_;
    ChunkWriter writer_;
};

/// Entries that are kept together, as a ChunkWriter has put them.
struct IndexChunk {
    std::string first;  ///< the key of the first, with which it began
    std::string bytes;
};

/// Every operation may throw SqliteError or Failure.
///
/// Threads: one thread; others may use the same file.
class FileIndex {
public:
    /// Opens the file, or makes it with its folder. One of another layout begins anew.
    explicit FileIndex(const std::string& path);
    static bool Exists(const std::string& path);
    /// REQUIRES that nobody uses it.
    static void Remove(const std::string& path);

    /// When it was in step with its copy; nothing: it is not.
    std::optional<IndexStamp> Stamp();
    void SetStamp(const IndexStamp& stamp);
    /// It is not in step with its copy any more.
    void Forget();

    /// For many reads. Nobody changes the file while it lives.
    Transaction Reading() { return Transaction(database_, Transaction::Kind::kRead); }
    /// Entries that are kept together: those that come after `key`, which is the last of such
    /// entries; none: there are no more. Nothing for `key`: the first of all.
    std::vector<IndexEntry> After(const std::optional<std::string>& key);
    /// Entries that are kept together, and with the key's if that has one. What comes after the key
    /// is among them, or after the last of them; none: it is the first of all.
    std::vector<IndexEntry> Around(const std::string& key);
    /// The same, not taken apart; no bytes: none.
    IndexChunk ChunkAround(const std::string& key);
    /// The first key of the entries that are kept together after the key's.
    std::optional<std::string> ChunkAfter(const std::string& key);
    /// The keys of a file that has several names.
    std::vector<std::string> NamesOf(uint64_t inode);

    /// Makes these changes, without those that `undone`, the keys of paths that were not sent,
    /// have to do with, and notes the stamp. All of it happens, or nothing.
    void Change(const IndexChanges& changes, const std::vector<std::string>& undone,
                const IndexStamp& stamp);

    /// Begins anew, without a stamp; all entries follow by Append() in the order of their keys, and
    /// then a stamp.
    void Clear();
    void Append(std::string_view key, const EntryFacts& facts);
    void EndAppending();

private:
    friend class ChunkEditor;

    IndexChunk Chunk(const char* which, std::string_view key);
    std::vector<IndexEntry> Take(const std::string& first);
    void Move(const std::string& from, const std::string& to);
    bool IsInFewChunks(const std::string& folder);
    void Split(const std::string& key);
    void Link(const std::string& key, const EntryFacts& facts);
    void Unlink(const std::string& key, const EntryFacts& facts);
    void Insert(const std::string& first, const std::string& entries);

    Database database_;
    ChunkWriter appended_;
    std::string first_appended_;
    size_t chunks_appended_ = 0;
};

}  // namespace zel_daemon
