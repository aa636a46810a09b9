// Changed paths of one share, folded to the fewest that cover them.
#pragma once

#include <cstddef>
#include <set>
#include <string>
#include <vector>

namespace zel_daemon {

/// Paths begin with "/" and name what changed below the share's folder; "/" is all of it. Each
/// stands for the whole tree below it, so a path below another one that is held adds nothing.
///
/// However many changes come, memory stays bounded: a set never holds more than kMaxHeld paths.
/// When it would, the paths of the fullest folders are replaced by their folder.
///
/// Costs: Add() is logarithmic in what is held and linear in the path's length, whatever the order
/// of the paths; Take() is n log n.
///
/// Threads: one thread.
class ChangeSet {
public:
    static constexpr size_t kMaxHeld = 4096;
    /// What Take() gives at most: each path costs a run of rsync.
    static constexpr size_t kMaxTaken = 16;

    /// Whether `path` is `above` or below it.
    static bool Covers(const std::string& above, const std::string& path);

    void Add(const std::string& path);
    bool Empty() const { return held_.empty(); }
    /// The folded paths, in byte order; the set is empty afterwards. Folding to kMaxTaken joins
    /// the paths that lie closest together, deepest first, so that the least is sent needlessly.
    std::vector<std::string> Take();

private:
    void Hold(std::string key);
    void FoldFullest();

    // Each path with NUL for "/", and nothing for the whole share: no name holds a NUL, and as the
    // lowest byte it makes what is below a path follow it directly. No path is below another.
    std::set<std::string> held_;
};

}  // namespace zel_daemon
