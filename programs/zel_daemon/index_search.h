// What has changed in a share while nobody watched, found here alone.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "programs/zel_daemon/file_index.h"
#include "programs/zel_daemon/loop_worker.h"

namespace zel_daemon {

/// Calls `on_change` for the paths that bring a copy into step which has all that the index says:
/// what is other, new or gone in the folder; a path that ends in "/" is that of a folder that went
/// with all that was below it. A new folder is one path. Of a folder itself a path in it is told:
/// what is sent brings the folders above along.
///
/// Costs: every entry is looked at once; what is held is some names of each folder on the way to
/// one. Throws Failure when the folder cannot be read, SqliteError when the index cannot.
void FindChanges(FileIndex& index, const std::string& folder,
                 const std::function<bool()>& cancelled,
                 const std::function<void(const std::string& path)>& on_change);

struct SearchOrder {
    uint64_t task_id = 0;
    std::string share;
    uint64_t number = 0;  ///< of TaskMachine::ToSearch()
    std::string index;    ///< its file
    std::string folder;   ///< the share's
};

struct SearchOutcome {
    std::string problem;  ///< why not all was found; empty: it was
    uint64_t changes = 0;
    int64_t compared = 0;  ///< the index's, see IndexStamp
};

/// A search on a thread of its own, which gives way to all else on the machine.
///
/// Threads: the loop's.
class IndexSearch {
public:
    using OnChanges = std::function<void(const std::vector<std::string>& paths)>;
    using OnEnd = std::function<void(const SearchOutcome&)>;

    /// Starts it; without a thread to be had it ends with that problem. Both functions are called
    /// on the loop's thread, after this; never once this object is gone.
    IndexSearch(EventLoop& loop, SearchOrder order, const OnChanges& on_changes,
                const OnEnd& on_end);
    /// Cancels and waits for the end.
    ~IndexSearch() { Cancel(); }
    IndexSearch(const IndexSearch&) = delete;
    IndexSearch& operator=(const IndexSearch&) = delete;

    /// Ends it soon, with a problem.
    void Cancel() { cancel_ = true; }
    const SearchOrder& Order() const { return order_; }

private:
    SearchOutcome Work(const OnChanges& on_changes);
    void Tell(const OnChanges& on_changes, std::vector<std::string> paths);

    const SearchOrder order_;
    std::atomic<bool> cancel_{false};
    std::atomic<int> waiting_{0};  // for the loop: parts that were told
    LoopWorker worker_;
};

}  // namespace zel_daemon
