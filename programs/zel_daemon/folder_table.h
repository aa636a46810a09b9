// The folders of watched trees, in little memory: some 100 bytes each.
#pragma once

#include <cstdint>
#include <deque>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "programs/zel_daemon/sip_hash.h"

namespace zel_daemon {

/// A folder's place in the table. It is used again once the folder was removed.
using FolderId = uint32_t;
constexpr FolderId kNoFolder = UINT32_MAX;

/// Trees of folders by name, each with the number of its watch. A folder is found by its parent and
/// name, and by its watch; several may have one watch, since a folder can be seen at several
/// places.
///
/// Threads: one thread.
class FolderTable {
public:
    struct Folder {
        int watch = -1;      ///< -1: none. Set by SetWatch() alone
        uint32_t owner = 0;  ///< the owner's, as are the marks
        uint8_t marks = 0;

        FolderId Parent() const { return parent_; }
        FolderId FirstChild() const { return first_child_; }
        FolderId NextSibling() const { return next_sibling_; }
        std::string_view Name() const { return {name_.get(), name_size_}; }

    private:
        friend class FolderTable;
        uint16_t name_size_ = 0;
        std::unique_ptr<char[]> name_;
        FolderId parent_ = kNoFolder;
        FolderId first_child_ = kNoFolder;
        FolderId next_sibling_ = kNoFolder;
        FolderId previous_sibling_ = kNoFolder;
        FolderId next_by_name_ = kNoFolder;
        FolderId next_by_watch_ = kNoFolder;  // of a removed folder: the next that is free
    };

    Folder& operator[](FolderId id) { return folders_[id]; }
    const Folder& operator[](FolderId id) const { return folders_[id]; }

    /// A new folder without parent, name and watch.
    FolderId Add(uint32_t owner);
    /// A folder without parent becomes the child of `parent`, which is in another tree and has no
    /// child of this name.
    void Attach(FolderId id, FolderId parent, std::string_view name);
    /// Takes a folder with all below it from its parent, if it has one.
    void Detach(FolderId id);
    /// A folder without parent, children and watch is forgotten.
    void Remove(FolderId id);

    FolderId Child(FolderId parent, std::string_view name) const;

    void SetWatch(FolderId id, int watch);
    bool HasWatch(int watch) const;
    std::vector<FolderId> WithWatch(int watch) const;

    /// Sets `path` to the way down to this folder from the one without parent, "/" before each
    /// name, and returns the latter.
    FolderId Locate(FolderId id, std::string* path) const;

private:
    /// Chains of folders that share a bucket, linked through one member of theirs. With a folder
    /// more comes a bucket more, which takes its part of one other's: buckets are never dealt out
    /// anew all at once, for which a large tree would hold up everything else.
    template <FolderId Folder::*kNext>
    class Index {
    public:
        FolderId First(uint64_t hash) const {
            return heads_.empty() ? kNoFolder : heads_[Bucket(hash)];
        }
        template <typename HashOf>
        void Insert(std::deque<Folder>& folders, FolderId id, const HashOf& hash_of);
        void Erase(std::deque<Folder>& folders, FolderId id, uint64_t hash);

    private:
        size_t Bucket(uint64_t hash) const {
            const auto bucket = static_cast<size_t>(hash & mask_);
            return bucket < heads_.size() ? bucket : bucket & (mask_ / 2);
        }

        std::vector<FolderId> heads_;
        size_t mask_ = 0;  // of as many bits as the last bucket's number has
        size_t count_ = 0;
    };

    uint64_t NameHash(FolderId parent, std::string_view name) const;
    uint64_t NameHash(FolderId id) const;

    SipHash hash_;
    std::deque<Folder> folders_;
    FolderId free_ = kNoFolder;
    Index<&Folder::next_by_name_> by_name_;
    Index<&Folder::next_by_watch_> by_watch_;
};

}  // namespace zel_daemon
