#include "programs/zel_daemon/change_set.h"

#include <algorithm>
#include <iterator>
#include <map>
#include <string_view>
#include <utility>

#include "programs/zel_daemon/path_key.h"

namespace zel_daemon {

namespace {

constexpr char kSeparator = '\0';

/// Folding to half leaves as many calls free of it as it costs.
constexpr size_t kHalf = 2;

/// The deepest folder that both are within. Neither is within the other.
std::string_view CommonFolder(std::string_view one, std::string_view other) {
    const auto differs = std::mismatch(one.begin(), one.end(), other.begin(), other.end()).first;
    return ParentOf(one.substr(0, static_cast<size_t>(differs - one.begin())));
}

/// A folder that two or more paths, neighbours in the order of keys, are within.
struct Joint {
    std::string_view folder;
    size_t depth;  // levels below the share
    size_t paths;  // what is left of them when all deeper joints have been made
};

/// The joints of sorted keys, none of which is within another.
std::vector<Joint> JointsOf(const std::vector<std::string>& keys) {
    std::vector<Joint> joints;
    std::vector<Joint> open;  // each is within the one before
    for (size_t i = 0; i + 1 < keys.size(); ++i) {
        const std::string_view folder = CommonFolder(keys[i], keys[i + 1]);
        while (!open.empty() && open.back().folder.size() > folder.size()) {
            joints.push_back(open.back());
            open.pop_back();
        }
        if (open.empty() || open.back().folder.size() < folder.size()) {
            const auto depth = std::count(folder.begin(), folder.end(), kSeparator);
            open.push_back({folder, static_cast<size_t>(depth), 1});
        }
        ++open.back().paths;
    }
    joints.insert(joints.end(), open.begin(), open.end());
    return joints;
}

/// Joins the sorted keys until no more than `wanted` are left.
std::vector<std::string> Join(const std::vector<std::string>& keys, size_t wanted) {
    std::vector<Joint> joints = JointsOf(keys);
    // The fullest first among equally deep ones: the fewest folders are sent whole then.
    std::sort(joints.begin(), joints.end(), [](const Joint& one, const Joint& other) {
        return std::pair(one.depth, one.paths) > std::pair(other.depth, other.paths);
    });
    std::set<std::string_view> folders;
    size_t left = keys.size();
    for (auto joint = joints.begin(); left > wanted && joint != joints.end(); ++joint) {
        left -= joint->paths - 1;
        // Those that were joined within this one are at its end of the order.
        auto within = folders.insert(joint->folder).first;
        for (++within; within != folders.end() && IsWithin(*within, joint->folder);) {
            within = folders.erase(within);
        }
    }
    std::vector<std::string> joined;
    for (const std::string& key : keys) {
        const auto after = folders.upper_bound(key);
        std::string_view covering = key;
        if (after != folders.begin() && IsWithin(key, *std::prev(after))) {
            covering = *std::prev(after);
        }
        if (joined.empty() || joined.back() != covering) {
            joined.emplace_back(covering);
        }
    }
    return joined;
}

}  // namespace

void ChangeSet::Add(const std::string& path) {
    Hold(KeyOf(path));
    if (IsFull(1)) {
        FoldFullest();
    }
}

bool ChangeSet::Holds(const std::string& path) const {
    return IsHeld(KeyOf(path));
}

bool ChangeSet::Touches(const std::string& path) const {
    const std::string key = KeyOf(path);
    const auto next = held_.upper_bound(key);
    return IsHeld(key) || (next != held_.end() && IsWithin(*next, key));
}

// Nothing that is held lies between a folder and what is within it.
bool ChangeSet::IsHeld(const std::string& key) const {
    const auto next = held_.upper_bound(key);
    return next != held_.begin() && IsWithin(key, *std::prev(next));
}

void ChangeSet::Hold(std::string key) {
    if (IsHeld(key)) {
        return;
    }
    auto next = held_.upper_bound(key);
    while (next != held_.end() && IsWithin(*next, key)) {
        bytes_ -= next->size();
        next = held_.erase(next);
    }
    bytes_ += key.size();
    held_.insert(next, std::move(key));
}

void ChangeSet::FoldFullest() {
    std::map<std::string, size_t> counts;
    for (const std::string& key : held_) {
        ++counts[std::string(ParentOf(key))];
    }
    std::vector<std::pair<size_t, std::string>> fullest;
    fullest.reserve(counts.size());
    for (const auto& [folder, count] : counts) {
        fullest.emplace_back(count, folder);
    }
    std::sort(fullest.rbegin(), fullest.rend());
    for (const auto& [count, folder] : fullest) {
        if (!IsFull(kHalf) || count < 2) {
            break;
        }
        Hold(folder);
    }
    if (IsFull(kHalf)) {  // folders with a path or two each
        const std::vector<std::string> keys(held_.begin(), held_.end());
        held_.clear();
        bytes_ = 0;
        for (std::string& key : Join(keys, std::min(keys.size(), kMaxHeld) / kHalf)) {
            Hold(std::move(key));
        }
    }
}

std::vector<std::string> ChangeSet::Take() {
    std::vector<std::string> paths;
    paths.reserve(held_.size());
    std::transform(held_.begin(), held_.end(), std::back_inserter(paths), PathOf);
    held_.clear();
    bytes_ = 0;
    std::sort(paths.begin(), paths.end());
    return paths;
}

}  // namespace zel_daemon
