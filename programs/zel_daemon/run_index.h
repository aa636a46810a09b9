// What a run does to the indexes of the shares that it sends.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "ZEL/sync_obj.h"
#include "programs/common/run_result.h"
#include "programs/zel_daemon/file_index.h"

namespace zel_daemon {

/// Where a task's indexes are, and for which settings they hold.
struct IndexPlace {
    std::string folder;  ///< empty: none are kept
    std::string settings;

    /// A share's.
    std::string FileOf(const std::string& share) const;
};

/// The place of a task's indexes. `folder`: of those of all tasks.
IndexPlace PlaceOf(const std::string& folder, uint64_t task_id, const ZEL::SyncInfo& info,
                   const std::vector<std::string>& excludes);

/// Before a run begins, what stands at its paths is looked at; when it has succeeded, that goes
/// into the index. So the index never has more than the copy: what changes from the look on is
/// other than it says. When all of a share is compared, its index is made anew; when paths are
/// sent, one that was not in step stays out of step.
///
/// What goes wrong with an index costs the index, and never the run.
///
/// Threads: one thread.
class RunIndexes {
public:
    /// Other names of files that were sent, whose content the copy has not got: by share.
    using Linked = std::vector<std::pair<std::string, std::string>>;

    /// Looks at the order's paths, and notes in it what little is to be sent of the folders that
    /// were moved, where the index has them as they are at their old place (ShareMove::instead).
    /// `order` outlives this. `moment`: now, in seconds since the epoch.
    RunIndexes(IndexPlace place, programs::RunOrder& order, int64_t moment,
               const std::function<bool()>& cancelled);
    ~RunIndexes();
    RunIndexes(const RunIndexes&) = delete;
    RunIndexes& operator=(const RunIndexes&) = delete;

    /// The run has ended so.
    Linked Ended(const programs::RunResult& result);

private:
    class Share;

    void FindLinked(Linked& linked) const;

    const IndexPlace place_;
    std::vector<std::unique_ptr<Share>> shares_;
};

}  // namespace zel_daemon
