#include "programs/zel_daemon/moved_folder.h"

#include <algorithm>
#include <string_view>

#include "programs/zel_daemon/index_chunk.h"
#include "programs/zel_daemon/index_lookup.h"
#include "programs/zel_daemon/index_walk.h"
#include "programs/zel_daemon/path_key.h"
#include "programs/zel_daemon/share_folder.h"
#include "programs/zel_daemon/tree_list.h"

namespace zel_daemon {

namespace {

// Of a folder that was moved, so many files are sent by name.
constexpr size_t kMostInstead = 1000;

}  // namespace

std::set<size_t> AloneIn(const std::vector<programs::ShareMove>& moves) {
    struct End {
        std::string key;
        size_t move;
    };
    std::vector<End> ends;
    std::set<size_t> alone;
    for (size_t i = 0; i < moves.size(); ++i) {
        ends.push_back({KeyOf(moves[i].from), i});
        ends.push_back({KeyOf(moves[i].to), i});
        alone.insert(alone.end(), i);
    }
    std::sort(ends.begin(), ends.end(),
              [](const End& one, const End& other) { return one.key < other.key; });
    std::vector<const End*> above;  // each within the one before
    for (const End& end : ends) {
        while (!above.empty() && !IsWithin(end.key, above.back()->key)) {
            above.pop_back();
        }
        if (!above.empty()) {
            alone.erase(end.move);
            alone.erase(above.back()->move);
        }
        above.push_back(&end);
    }
    return alone;
}

MovedFolder LookAtMoved(FileIndex& index, const std::string& folder,
                        const programs::ShareMove& move, size_t most_bytes,
                        const std::function<bool()>& cancelled) {
    const std::string from = KeyOf(move.from);
    const std::string to = KeyOf(move.to);
    IndexLookup lookup(index);
    const EntryFacts* const was = lookup.Find(from);
    TreeList list(folder, move.to, cancelled);
    TreeList::Entry entry;
    if (was == nullptr || !was->IsFolder() || list.Next(entry) != TreeList::Found::kEntry ||
        !entry.facts.IsFolder() || entry.facts.inode != was->inode) {
        return {};
    }
    std::vector<std::string> files;
    ChunkWriter entries;
    entries.Add(to, entry.facts);
    std::string waits = to;  // the folder that a file in it is to bring along; empty: none
    const auto below = [](const std::string& key, const std::string& top) {
        return std::string_view(key).substr(top.size());
    };
    IndexWalk known(index, from);
    auto found = list.Next(entry);
    for (; found == TreeList::Found::kEntry; found = list.Next(entry)) {
        const IndexEntry* const old = known.Entry();
        const std::string key = KeyOf(entry.path);
        if (old == nullptr || !IsWithin(old->key, from) ||
            below(old->key, from) != below(key, to) ||
            old->facts.IsFolder() != entry.facts.IsFolder() || files.size() == kMostInstead ||
            entries.Bytes().size() > most_bytes) {
            return {};
        }
        entries.Add(key, entry.facts);
        const bool is_unchanged = IsUnchanged(old->facts, entry.facts);
        if (entry.facts.IsFolder() && !is_unchanged) {
            if (!waits.empty() && !IsWithin(key, waits)) {
                return {};
            }
            waits = key;
        } else if (!entry.facts.IsFolder() && (!is_unchanged || !waits.empty())) {
            if (!waits.empty() && !IsWithin(key, waits)) {
                return {};
            }
            files.push_back(entry.path);
            waits.clear();
        }
        known.Next();
    }
    const bool is_more = known.Entry() != nullptr && IsWithin(known.Entry()->key, from);
    const bool is_all = found == TreeList::Found::kEnd && !is_more && waits.empty();
    return is_all && !cancelled() ? MovedFolder{files, entries.Take()} : MovedFolder();
}

std::optional<std::string> FileOfUntouched(FileIndex& index, const base::UniqueFd& share,
                                           const programs::ShareMove& move) {
    const std::string from = KeyOf(move.from);
    IndexLookup lookup(index);
    const EntryFacts* const was = lookup.Find(from);
    const auto is = FactsAt(share, move.to);
    if (was == nullptr || !was->IsFolder() || !is || is->inode != was->inode) {
        return std::nullopt;
    }
    IndexWalk known(index, from);
    const auto is_below = [&] {
        return known.Entry() != nullptr && IsWithin(known.Entry()->key, from);
    };
    while (is_below() && known.Entry()->facts.IsFolder()) {
        known.Next();
    }
    if (!is_below()) {
        return std::nullopt;
    }
    const std::string file = move.to + PathOf(known.Entry()->key.substr(from.size()));
    const auto there = FactsAt(share, file);
    const bool is_it = there && there->inode == known.Entry()->facts.inode;
    return is_it ? std::optional(file) : std::nullopt;
}

}  // namespace zel_daemon
