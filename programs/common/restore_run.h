// Brings files of a share back from its server.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "ZEL/sync_obj.h"
#include "programs/common/run_result.h"
#include "tarq/rsync_wrapper.h"

namespace programs {

/// What is to come back, and where to.
struct RestoreOrder {
    std::string share;
    std::string folder;              ///< exists when on_open() has returned
    std::vector<std::string> paths;  ///< relative to the share, see PathInShare(); empty: all
    /// The folder had something in it: its own owner, mode and times stay as they are.
    bool keep_folder = false;
    std::optional<int64_t> at;  ///< as it stood then, seconds since the epoch; else as it is
    bool overwrite = false;     ///< replace what is there and differs
    bool dry_run = false;
};

/// Callbacks on the running thread; each may be empty.
struct RestoreListener {
    std::function<void()> on_open;  ///< the server gives the share: its files come next
    std::function<void(const TARQ::Backup::RunProgress&)> on_progress;
    std::function<void(const TARQ::Backup::RunChange&)> on_change;
};

/// What one connection replaced or deleted at the server, of a share or below a path of it.
struct ShareVersion {
    int64_t until = 0;  ///< when the connection ended, seconds since the epoch
    uint64_t files = 0;
    uint64_t bytes = 0;
    int64_t since = 0;  ///< of a single file: when it came there; 0: not known
};

struct ShareVersions {
    std::vector<ShareVersion> versions;  ///< the youngest first
    bool more = false;                   ///< older ones were left out
};

/// One connection to the server that has the copy. Failures are thrown as RunFailure.
///
/// Threads: for use by one thread; `cancel` may be set by any thread, and by a signal handler.
class RestoreRun {
public:
    /// `cancel` must outlive this object.
    RestoreRun(const ZEL::SyncInfo& info, const std::atomic<bool>& cancel);
    ~RestoreRun();
    RestoreRun(const RestoreRun&) = delete;
    RestoreRun& operator=(const RestoreRun&) = delete;

    /// Finds an address at which the server answers. Changes nothing there.
    void Connect();
    /// Brings the files back. The server's copy stays as it is.
    TARQ::Backup::RunReport Restore(const RestoreOrder& order, const RestoreListener& listener);
    /// When the share, or what is at `path` of it (relative; empty: all), has changed.
    ShareVersions Versions(const std::string& share, const std::string& path);

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace programs
