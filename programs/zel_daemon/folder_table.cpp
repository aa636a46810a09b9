#include "programs/zel_daemon/folder_table.h"

#include <cstring>
#include <utility>

namespace zel_daemon {

namespace {

/// The kernel counts watches up, which spreads them best.
uint64_t WatchHash(int watch) {
    return static_cast<uint64_t>(watch);
}

}  // namespace

template <FolderId FolderTable::Folder::*kNext>
template <typename HashOf>
void FolderTable::Index<kNext>::Insert(std::deque<Folder>& folders, FolderId id,
                                       const HashOf& hash_of) {
    const auto link = [&](FolderId which) {
        FolderId& head = heads_[Bucket(hash_of(which))];
        folders[which].*kNext = std::exchange(head, which);
    };
    if (count_ == heads_.size()) {
        mask_ = count_ > mask_ ? mask_ * 2 + 1 : mask_;
        heads_.push_back(kNoFolder);
        FolderId& divided = heads_[count_ & (mask_ / 2)];
        for (FolderId at = std::exchange(divided, kNoFolder); at != kNoFolder;) {
            const FolderId next = folders[at].*kNext;
            link(at);
            at = next;
        }
    }
    link(id);
    ++count_;
}

template <FolderId FolderTable::Folder::*kNext>
void FolderTable::Index<kNext>::Erase(std::deque<Folder>& folders, FolderId id, uint64_t hash) {
    FolderId* at = &heads_[Bucket(hash)];
    while (*at != id) {
        at = &(folders[*at].*kNext);
    }
    *at = std::exchange(folders[id].*kNext, kNoFolder);
    --count_;
}

uint64_t FolderTable::NameHash(FolderId parent, std::string_view name) const {
    return hash_(parent, name);
}

uint64_t FolderTable::NameHash(FolderId id) const {
    return NameHash(folders_[id].parent_, folders_[id].Name());
}

FolderId FolderTable::Add(uint32_t owner) {
    FolderId id = free_;
    if (id == kNoFolder) {
        id = static_cast<FolderId>(folders_.size());
        folders_.emplace_back();
    } else {
        free_ = folders_[id].next_by_watch_;
        folders_[id] = Folder();
    }
    folders_[id].owner = owner;
    return id;
}

void FolderTable::Attach(FolderId id, FolderId parent, std::string_view name) {
    Folder& folder = folders_[id];
    folder.name_.reset(new char[name.size()]);
    folder.name_size_ = static_cast<uint16_t>(name.size());
    std::memcpy(folder.name_.get(), name.data(), name.size());
    folder.parent_ = parent;
    by_name_.Insert(folders_, id, [this](FolderId which) { return NameHash(which); });
    folder.next_sibling_ = std::exchange(folders_[parent].first_child_, id);
    if (folder.next_sibling_ != kNoFolder) {
        folders_[folder.next_sibling_].previous_sibling_ = id;
    }
}

void FolderTable::Detach(FolderId id) {
    Folder& folder = folders_[id];
    if (folder.parent_ == kNoFolder) {
        return;
    }
    by_name_.Erase(folders_, id, NameHash(id));
    const FolderId next = std::exchange(folder.next_sibling_, kNoFolder);
    const FolderId previous = std::exchange(folder.previous_sibling_, kNoFolder);
    if (next != kNoFolder) {
        folders_[next].previous_sibling_ = previous;
    }
    (previous == kNoFolder ? folders_[folder.parent_].first_child_
                           : folders_[previous].next_sibling_) = next;
    folder.parent_ = kNoFolder;
}

void FolderTable::Remove(FolderId id) {
    folders_[id] = Folder();
    folders_[id].next_by_watch_ = std::exchange(free_, id);
}

FolderId FolderTable::Child(FolderId parent, std::string_view name) const {
    FolderId at = by_name_.First(NameHash(parent, name));
    while (at != kNoFolder && (folders_[at].parent_ != parent || folders_[at].Name() != name)) {
        at = folders_[at].next_by_name_;
    }
    return at;
}

void FolderTable::SetWatch(FolderId id, int watch) {
    Folder& folder = folders_[id];
    if (folder.watch >= 0) {
        by_watch_.Erase(folders_, id, WatchHash(folder.watch));
    }
    folder.watch = watch;
    if (watch >= 0) {
        by_watch_.Insert(folders_, id,
                         [this](FolderId which) { return WatchHash(folders_[which].watch); });
    }
}

bool FolderTable::HasWatch(int watch) const {
    return !WithWatch(watch).empty();
}

std::vector<FolderId> FolderTable::WithWatch(int watch) const {
    std::vector<FolderId> found;
    for (FolderId at = by_watch_.First(WatchHash(watch)); at != kNoFolder;
         at = folders_[at].next_by_watch_) {
        if (folders_[at].watch == watch) {
            found.push_back(at);
        }
    }
    return found;
}

FolderId FolderTable::Locate(FolderId id, std::string* path) const {
    size_t size = 0;
    FolderId top = id;
    for (; folders_[top].parent_ != kNoFolder; top = folders_[top].parent_) {
        size += 1 + folders_[top].name_size_;
    }
    path->resize(size);
    for (FolderId at = id; at != top; at = folders_[at].parent_) {
        size -= folders_[at].name_size_;
        folders_[at].Name().copy(path->data() + size, folders_[at].name_size_);
        (*path)[--size] = '/';
    }
    return top;
}

}  // namespace zel_daemon
