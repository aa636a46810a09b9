// Changed paths of one share, folded to the fewest that cover them.
#pragma once

#include <cstddef>
#include <map>
#include <string>
#include <vector>

namespace zel_daemon {

/// Paths begin with "/" and name what changed below the share's folder; "/" is all of it. Each
/// stands for the whole tree below it, so a path below another one that is held adds nothing.
///
/// However many changes come, memory stays bounded: a set never holds more than kMaxHeld paths.
/// When it would, the paths of the fullest folders are replaced by their folder.
///
/// Threads: one thread.
class ChangeSet {
public:
    static constexpr size_t kMaxHeld = 4096;
    /// What Take() gives at most: each path costs a run of rsync.
    static constexpr size_t kMaxTaken = 16;

    void Add(const std::string& path);
    bool Empty() const;
    /// The folded paths, in byte order; the set is empty afterwards. Folding to kMaxTaken joins
    /// the paths that lie closest together, deepest first, so that the least is sent needlessly.
    std::vector<std::string> Take();

private:
    struct Node {
        bool changed = false;  // this whole tree
        std::map<std::string, Node> children;
    };

    Node root_;
    size_t held_ = 0;
};

}  // namespace zel_daemon
