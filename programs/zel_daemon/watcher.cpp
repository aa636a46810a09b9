#include "programs/zel_daemon/watcher.h"

#include <map>
#include <utility>

#include "programs/zel_daemon/folder_scan.h"
#include "programs/zel_daemon/watch_events.h"
#include "programs/zel_daemon/watched_tree.h"

namespace zel_daemon {

namespace {

/// Work goes in turns of some events and some steps of scan: enough events that the kernel's
/// queue does not overflow meanwhile, and enough steps that a flood of events does not keep new
/// folders from being watched.
constexpr int kStepsPerBusyTurn = 16;
constexpr int kStepsPerIdleTurn = 256;

}  // namespace

struct Watcher::Impl {
    Impl(OnChange change, OnMove move, OnLoss loss)
        : tree{std::move(change), std::move(move), std::move(loss), {}, {}, {}, {}, {}, false} {}

    WatchedTree tree;
    FolderScan scan{tree};
    WatchEvents events{tree, scan};
    std::map<std::string, uint32_t> numbers;  // of shares, by name; never used again
    uint32_t last_number = 0;
};

Watcher::Watcher(OnChange on_change, OnMove on_move, OnLoss on_loss)
    : impl_(std::make_unique<Impl>(std::move(on_change), std::move(on_move), std::move(on_loss))) {}

Watcher::~Watcher() = default;

bool Watcher::Open() {
    return impl_->tree.inotify.Open() == 0;
}

int Watcher::Fd() const {
    return impl_->tree.inotify.Fd();
}

void Watcher::Add(const std::string& share, const std::string& folder) {
    Remove(share);
    const uint32_t number = ++impl_->last_number;
    impl_->numbers[share] = number;
    WatchedTree::Share& added = impl_->tree.shares[number];
    added.name = share;
    added.folder = folder;
    added.root = impl_->tree.table.Add(number);
    impl_->scan.Enqueue(added.root, false);
}

void Watcher::Remove(const std::string& share) {
    const auto number = impl_->numbers.find(share);
    if (number == impl_->numbers.end()) {
        return;
    }
    const auto found = impl_->tree.shares.find(number->second);
    if (found->second.root != kNoFolder) {
        impl_->tree.Drop(found->second.root);
    }
    impl_->tree.shares.erase(found);
    impl_->numbers.erase(number);
}

void Watcher::Rescan(const std::string& share) {
    const auto number = impl_->numbers.find(share);
    if (number == impl_->numbers.end()) {
        return;
    }
    WatchedTree::Share& found = impl_->tree.shares.at(number->second);
    if (found.root != kNoFolder) {
        impl_->scan.Enqueue(found.root, true);
        found.notified.clear();
    }
}

bool Watcher::Work(std::chrono::milliseconds budget) {
    const auto end = std::chrono::steady_clock::now() + budget;
    bool more_events = true;
    bool in_time = true;
    while (in_time && (more_events || impl_->scan.HasSteps() || impl_->tree.is_ahead)) {
        more_events = impl_->events.HandleSome();
        const int steps = more_events ? kStepsPerBusyTurn : kStepsPerIdleTurn;
        for (int i = 0; in_time && i < steps && impl_->scan.HasSteps(); ++i) {
            impl_->scan.Step();
            in_time = std::chrono::steady_clock::now() < end;
        }
        in_time = in_time && std::chrono::steady_clock::now() < end;
    }
    return impl_->scan.HasSteps() || impl_->events.HasMoves() || impl_->tree.inotify.Buffered();
}

WatchStats Watcher::Stats(const std::string& share) const {
    const auto number = impl_->numbers.find(share);
    if (number == impl_->numbers.end()) {
        return WatchStats();
    }
    const WatchedTree::Share& found = impl_->tree.shares.at(number->second);
    WatchStats stats;
    stats.complete = found.root != kNoFolder && found.missing == 0;
    if (found.root != kNoFolder) {
        stats.folders = found.watched;
        stats.scanning = found.jobs != 0;
    }
    return stats;
}

WatchStats Watcher::Stats() const {
    WatchStats all;
    all.complete = true;
    for (const auto& [share, number] : impl_->numbers) {
        const WatchStats one = Stats(share);
        all.folders += one.folders;
        all.scanning = all.scanning || one.scanning;
        all.complete = all.complete && one.complete;
    }
    return all;
}

}  // namespace zel_daemon
