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
/// However many changes come, memory stays bounded: a set never holds more than kMaxHeld paths, nor
/// much more than kMaxBytes of them. When it would, the paths of the fullest folders are replaced
/// by their folder.
///
/// Costs: Add() is logarithmic in what is held and linear in the path's length, whatever the order
/// of the paths.
///
/// Threads: one thread.
class ChangeSet {
public:
    static constexpr size_t kMaxHeld = 65536;
    static constexpr size_t kMaxBytes = size_t{16} << 20;

    void Add(const std::string& path);
    /// Whether the path, or a folder above it, is held.
    bool Holds(const std::string& path) const;
    /// The same, or something below it.
    bool Touches(const std::string& path) const;
    bool Empty() const { return held_.empty(); }
    /// The paths, in byte order; the set is empty afterwards.
    std::vector<std::string> Take();

private:
    bool IsHeld(const std::string& key) const;
    void Hold(std::string key);
    bool IsFull(size_t part) const {
        return held_.size() > kMaxHeld / part || bytes_ > kMaxBytes / part;
    }
    void FoldFullest();

    // Each path with NUL for "/", and nothing for the whole share: no name holds a NUL, and as the
    // lowest byte it makes what is below a path follow it directly. No path is below another.
    std::set<std::string> held_;
    size_t bytes_ = 0;  // of these
};

}  // namespace zel_daemon
