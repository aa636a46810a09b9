#include "programs/zel_daemon/file_index.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <iterator>
#include <utility>

#include "base/make_folder.h"
#include "base/unique_fd.h"
#include "programs/common/failure.h"
#include "programs/zel_daemon/index_walk.h"
#include "programs/zel_daemon/path_key.h"

namespace zel_daemon {

namespace {

constexpr int kLayout = 2;
// Two chunks fill a page.
constexpr char kPages[] = "PRAGMA page_size = 8192; PRAGMA cache_size = -1024";
constexpr size_t kChunkBytes = 4000;
// So many entries are held when a run brings many in one place.
constexpr size_t kMostHeld = 8192;
// Chunks that are appended in one transaction.
constexpr size_t kChunksTogether = 1024;
// A folder that fills more chunks is moved by them.
constexpr int64_t kFewChunks = 8;
// Of an entry that says that what was at and below its key is void: no entry has this mode.
constexpr uint32_t kReplaced = 0;

constexpr char kSchema[] = R"(
CREATE TABLE chunks (
    first BLOB PRIMARY KEY,       -- the key of its first entry
    content INTEGER NOT NULL
) WITHOUT ROWID;
CREATE TABLE contents (           -- of chunks: entries, which do not say where the first is
    id INTEGER PRIMARY KEY,
    entries BLOB NOT NULL
);
CREATE TABLE links (              -- files that have several names
    inode INTEGER NOT NULL,
    key BLOB NOT NULL,
    PRIMARY KEY (inode, key)
) WITHOUT ROWID;
CREATE TABLE stamp (              -- one, or none: the index is not in step with its copy
    settings BLOB NOT NULL,
    identity TEXT NOT NULL,
    generation INTEGER NOT NULL,
    push TEXT NOT NULL,
    begun TEXT NOT NULL,
    compared INTEGER NOT NULL
);
)";

std::string MakeFile(const std::string& path) {
    const std::string folder = path.substr(0, path.rfind('/'));
    if (!base::MakeFolder(folder.substr(0, folder.rfind('/')), 0700) ||
        !base::MakeFolder(folder, 0700)) {
        throw programs::SystemFailure("cannot make " + folder, programs::FailureKind::kLocal);
    }
    const base::UniqueFd file(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
    if (!file) {
        throw programs::SystemFailure("cannot make " + path, programs::FailureKind::kLocal);
    }
    return path;
}

std::vector<IndexEntry> EntriesOf(const IndexChunk& chunk) {
    std::vector<IndexEntry> entries;
    ChunkReader reader(chunk.bytes, chunk.first);
    for (IndexEntry entry; reader.Next(entry);) {
        entries.push_back(entry);
    }
    return entries;
}

std::string AfterAllBelow(const std::string& key) {
    return key + '\x01';
}

}  // namespace

void IndexChanges::Replace(std::string_view key) {
    EntryFacts facts;
    facts.mode = kReplaced;
    writer_.Add(key, facts);
}

/// Changes an index in the order of its keys: the chunk that is being changed is held, and written
/// when the next one is touched.
class ChunkEditor {
public:
    explicit ChunkEditor(FileIndex& index) : index_(index) {}

    void Put(const IndexEntry& entry) {
        Hold(entry.key);
        const auto at = Find(entry.key);
        const auto place = at - entries_.begin();
        if (at != entries_.end() && at->key == entry.key) {
            index_.Unlink(at->key, at->facts);
            *at = entry;
        } else {
            entries_.insert(at, entry);
        }
        index_.Link(entry.key, entry.facts);
        if (entries_.size() > kMostHeld) {
            Write(place);
        }
    }

    /// Removes the key and all below it, which is added to `removed` unless that is null.
    void Remove(const std::string& key, std::vector<IndexEntry>* removed = nullptr) {
        Hold(key);
        const std::string end = AfterAllBelow(key);
        for (;;) {
            const auto first = Find(key);
            const auto last = Find(end);
            std::for_each(first, last,
                          [&](const IndexEntry& entry) { index_.Unlink(entry.key, entry.facts); });
            if (removed != nullptr) {
                std::move(first, last, std::back_inserter(*removed));
            }
            entries_.erase(first, last);
            if (!limit_ || *limit_ >= end) {
                return;
            }
            const std::string next = *limit_;
            std::vector<IndexEntry> entries = Take(next);
            std::move(entries.begin(), entries.end(), std::back_inserter(entries_));
        }
    }

    void Write() { Write(static_cast<ptrdiff_t>(entries_.size())); }

private:
    // Of what is held, the first that does not come before the key.
    std::vector<IndexEntry>::iterator Find(const std::string& key) {
        return std::lower_bound(
            entries_.begin(), entries_.end(), key,
            [](const IndexEntry& held, const std::string& wanted) { return held.key < wanted; });
    }

    // Has the chunk in which the key belongs.
    void Hold(const std::string& key) {
        if (held_ && (!limit_ || key < *limit_)) {
            return;
        }
        Write();
        Query chunk(index_.database_,
                    "SELECT first FROM chunks WHERE first <= ? ORDER BY first DESC LIMIT 1",
                    Bytes{key});
        if (chunk.Next()) {
            entries_ = Take(chunk.Text());
        } else {
            limit_ = index_.ChunkAfter(key);
        }
        held_ = true;
    }

    // The entries of this chunk, which is no more.
    std::vector<IndexEntry> Take(const std::string& first) {
        limit_ = index_.ChunkAfter(first);
        return index_.Take(first);
    }

    // Writes the first `count` entries that are held, in chunks of one size.
    void Write(ptrdiff_t count) {
        ChunkWriter all;
        if (count > 0) {
            all.Begin(entries_.front().key);
        }
        std::for_each(entries_.begin(), entries_.begin() + count,
                      [&](const IndexEntry& entry) { all.Add(entry.key, entry.facts); });
        const size_t bytes = all.Bytes().size();
        if (count > 0 && bytes < kChunkBytes) {
            index_.Insert(entries_.front().key, all.Take());
            entries_.erase(entries_.begin(), entries_.begin() + count);
            return;
        }
        const size_t most = bytes / (bytes / kChunkBytes + 1) + 1;
        ChunkWriter chunk;
        const std::string* first = nullptr;
        for (ptrdiff_t i = 0; i < count; ++i) {
            const IndexEntry& entry = entries_[static_cast<size_t>(i)];
            if (chunk.Empty()) {
                first = &entry.key;
                chunk.Begin(*first);
            }
            chunk.Add(entry.key, entry.facts);
            if (chunk.Bytes().size() >= most || i + 1 == count) {
                index_.Insert(*first, chunk.Take());
            }
        }
        entries_.erase(entries_.begin(), entries_.begin() + count);
    }

    FileIndex& index_;
    bool held_ = false;
    std::vector<IndexEntry> entries_;
    std::optional<std::string> limit_;  // where the next chunk begins; nothing: there is none
};

FileIndex::FileIndex(const std::string& path) : database_(MakeFile(path)) {
    database_.Execute(kPages);
    if (database_.Number("PRAGMA user_version") != kLayout) {
        Transaction transaction(database_);
        database_.Execute(
            "DROP TABLE IF EXISTS chunks; DROP TABLE IF EXISTS contents; "
            "DROP TABLE IF EXISTS links; DROP TABLE IF EXISTS stamp");
        database_.Execute(kSchema);
        database_.Execute(("PRAGMA user_version = " + std::to_string(kLayout)).c_str());
        transaction.Commit();
    }
}

bool FileIndex::Exists(const std::string& path) {
    return access(path.c_str(), F_OK) == 0;
}

void FileIndex::Remove(const std::string& path) {
    unlink(path.c_str());
    unlink((path + "-journal").c_str());
}

std::optional<IndexStamp> FileIndex::Stamp() {
    Query query(database_,
                "SELECT settings, identity, generation, push, begun, compared FROM stamp");
    if (!query.Next()) {
        return std::nullopt;
    }
    IndexStamp stamp;
    stamp.settings = query.Text();
    stamp.copy.identity = query.Text();
    stamp.copy.generation = static_cast<uint64_t>(query.Number());
    stamp.copy.push = query.Text();
    const std::string begun = query.Text();
    for (size_t begin = 0; begin < begun.size();) {
        const size_t end = std::min(begun.find(' ', begin), begun.size());
        stamp.begun.push_back(begun.substr(begin, end - begin));
        begin = end + 1;
    }
    stamp.compared = query.Number();
    return stamp;
}

void FileIndex::SetStamp(const IndexStamp& stamp) {
    std::string begun;
    for (const std::string& mark : stamp.begun) {
        begun += (begun.empty() ? "" : " ") + mark;
    }
    database_.Execute("DELETE FROM stamp");
    Query(database_,
          "INSERT INTO stamp (settings, identity, generation, push, begun, compared) "
          "VALUES (?, ?, ?, ?, ?, ?)",
          Bytes{stamp.settings}, stamp.copy.identity, stamp.copy.generation, stamp.copy.push, begun,
          stamp.compared)
        .Run();
}

void FileIndex::Forget() {
    database_.Execute("DELETE FROM stamp");
}

std::vector<IndexEntry> FileIndex::After(const std::optional<std::string>& key) {
    return EntriesOf(
        Chunk(key ? "first > ? ORDER BY first LIMIT 1" : "first >= ? ORDER BY first LIMIT 1",
              key ? *key : std::string_view()));
}

std::vector<IndexEntry> FileIndex::Around(const std::string& key) {
    return EntriesOf(ChunkAround(key));
}

IndexChunk FileIndex::ChunkAround(const std::string& key) {
    return Chunk("first <= ? ORDER BY first DESC LIMIT 1", key);
}

// `which`: of the chunks, with one parameter, the key.
IndexChunk FileIndex::Chunk(const char* which, std::string_view key) {
    IndexChunk chunk;
    Query query(
        database_,
        std::string("SELECT first, entries FROM chunks JOIN contents ON id = content WHERE ") +
            which,
        Bytes{key});
    if (query.Next()) {
        chunk.first = query.Text();
        chunk.bytes = query.Text();
    }
    return chunk;
}

// The entries of this chunk, which is no more.
std::vector<IndexEntry> FileIndex::Take(const std::string& first) {
    std::vector<IndexEntry> entries = EntriesOf(Chunk("first = ?", first));
    Query(database_, "DELETE FROM contents WHERE id = (SELECT content FROM chunks WHERE first = ?)",
          Bytes{first})
        .Run();
    Query(database_, "DELETE FROM chunks WHERE first = ?", Bytes{first}).Run();
    return entries;
}

std::optional<std::string> FileIndex::ChunkAfter(const std::string& key) {
    Query next(database_, "SELECT first FROM chunks WHERE first > ? ORDER BY first LIMIT 1",
               Bytes{key});
    return next.Next() ? std::optional(next.Text()) : std::nullopt;
}

std::vector<std::string> FileIndex::NamesOf(uint64_t inode) {
    std::vector<std::string> keys;
    Query query(database_, "SELECT key FROM links WHERE inode = ?", inode);
    while (query.Next()) {
        keys.push_back(query.Text());
    }
    return keys;
}

void FileIndex::Link(const std::string& key, const EntryFacts& facts) {
    if (facts.linked) {
        Query(database_, "INSERT OR IGNORE INTO links (inode, key) VALUES (?, ?)", facts.inode,
              Bytes{key})
            .Run();
    }
}

void FileIndex::Unlink(const std::string& key, const EntryFacts& facts) {
    if (facts.linked) {
        Query(database_, "DELETE FROM links WHERE inode = ? AND key = ?", facts.inode, Bytes{key})
            .Run();
    }
}

void FileIndex::Insert(const std::string& first, const std::string& entries) {
    Query(database_, "INSERT INTO contents (entries) VALUES (?)", Bytes{entries}).Run();
    Query(database_, "INSERT INTO chunks (first, content) VALUES (?, ?)", Bytes{first},
          database_.LastId())
        .Run();
}

void FileIndex::Change(const IndexChanges& changes, const std::vector<std::string>& undone,
                       const IndexStamp& stamp) {
    const auto any = [&](const auto& test) {
        return std::any_of(undone.begin(), undone.end(), test);
    };
    const auto is_undone = [&](const std::string& key) {
        return any(
            [&](const std::string& path) { return IsWithin(key, path) || IsWithin(path, key); });
    };
    Transaction transaction(database_);
    for (const auto& [from, to] : changes.moves_) {
        if (!is_undone(from) && !is_undone(to)) {
            Move(from, to);
        }
    }
    ChunkEditor editor(*this);
    std::optional<std::string> replaced;
    bool left_out = false;
    ChunkReader reader(changes.writer_.Bytes());
    for (IndexEntry entry; reader.Next(entry);) {
        const std::string& key = entry.key;
        if (entry.facts.mode == kReplaced) {
            replaced = key;
            left_out = is_undone(key);
            if (!left_out) {
                editor.Remove(key);
            }
        } else if (replaced && IsWithin(key, *replaced)
                       ? !left_out
                       : !any([&](const std::string& path) { return IsWithin(path, key); })) {
            editor.Put(entry);
        }
    }
    editor.Write();
    SetStamp(stamp);
    transaction.Commit();
}

// A folder of few chunks is put among what is at its new place, so that chunks are not small.
void FileIndex::Move(const std::string& from, const std::string& to) {
    const auto remove = [this](const std::string& key, std::vector<IndexEntry>* removed) {
        ChunkEditor editor(*this);
        editor.Remove(key, removed);
        editor.Write();
    };
    remove(to, nullptr);
    if (IsInFewChunks(from)) {
        std::vector<IndexEntry> moved;
        remove(from, &moved);
        ChunkEditor editor(*this);
        for (IndexEntry& entry : moved) {
            entry.key.replace(0, from.size(), to);
            editor.Put(entry);
        }
        editor.Write();
        return;
    }
    const std::string end = AfterAllBelow(from);
    for (const std::string& key : {from, end, to}) {
        Split(key);
    }
    for (const char* update :
         {"UPDATE chunks SET first = CAST(? || substr(first, ?) AS BLOB) WHERE first >= ? AND "
          "first < ?",
          "UPDATE links SET key = CAST(? || substr(key, ?) AS BLOB) WHERE key >= ? AND key < ?"}) {
        Query(database_, update, Bytes{to}, from.size() + 1, Bytes{from}, Bytes{end}).Run();
    }
}

bool FileIndex::IsInFewChunks(const std::string& folder) {
    Query chunks(
        database_,
        "SELECT count(*) FROM (SELECT 1 FROM chunks WHERE first >= ? AND first < ? LIMIT ?)",
        Bytes{folder}, Bytes{AfterAllBelow(folder)}, kFewChunks + 1);
    chunks.Next();
    return chunks.Number() <= kFewChunks;
}

// A chunk begins at the key, or none has it in its midst.
void FileIndex::Split(const std::string& key) {
    const std::vector<IndexEntry> around = Around(key);
    if (around.empty() || around.front().key == key || around.back().key < key) {
        return;
    }
    ChunkWriter before;
    ChunkWriter after;
    const std::string* first_after = nullptr;
    before.Begin(around.front().key);
    for (const IndexEntry& entry : around) {
        if (entry.key >= key && first_after == nullptr) {
            first_after = &entry.key;
            after.Begin(entry.key);
        }
        (first_after == nullptr ? before : after).Add(entry.key, entry.facts);
    }
    Take(around.front().key);
    Insert(around.front().key, before.Take());
    Insert(*first_after, after.Take());
}

// What is appended before the stamp need not be on the disk: the stamp's own transaction brings it
// there, or nothing is trusted.
void FileIndex::Clear() {
    database_.Execute(
        "PRAGMA synchronous = FULL; DELETE FROM stamp; PRAGMA synchronous = OFF; "
        "DELETE FROM chunks; DELETE FROM contents; DELETE FROM links; BEGIN IMMEDIATE");
    appended_.Take();
    chunks_appended_ = 0;
}

void FileIndex::Append(std::string_view key, const EntryFacts& facts) {
    if (appended_.Empty()) {
        first_appended_ = key;
        appended_.Begin(key);
    }
    appended_.Add(key, facts);
    if (facts.linked) {
        Link(std::string(key), facts);
    }
    if (appended_.Bytes().size() >= kChunkBytes - 100) {
        Insert(first_appended_, appended_.Take());
        if (++chunks_appended_ % kChunksTogether == 0) {
            database_.Execute("COMMIT; BEGIN IMMEDIATE");
        }
    }
}

void FileIndex::EndAppending() {
    if (!appended_.Empty()) {
        Insert(first_appended_, appended_.Take());
    }
    database_.Execute("COMMIT; PRAGMA synchronous = FULL");
}

}  // namespace zel_daemon
