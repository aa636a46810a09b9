// What a push sends of a share, and in how many runs of rsync.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "programs/common/copy_push.h"
#include "programs/common/server_session.h"
#include "programs/common/task_run.h"

namespace programs {

/// The paths of a share go to one rsync as a list, where all goes well. More runs are made for what
/// the brake has to look at first, for a file that a broken push has left in the midst, for a
/// server that does not take deletions by their names, for what cannot be read, and for other
/// limits of the bandwidth.
///
/// Failures of a share are thrown as RunFailure.
///
/// Threads: for use by one thread, as the session is.
class ShareSender {
public:
    /// What was sent of all shares.
    struct Sums {
        std::map<std::string, CopyChanges> copies;  ///< by share
        std::set<std::string> moved;  ///< the shares whose moves were told, or are void
        uint64_t rsync_runs = 0;      ///< that sent something
    };

    /// Both must outlive this object.
    ShareSender(ServerSession& session, const RunListener& listener);
    ~ShareSender();
    ShareSender(const ShareSender&) = delete;
    ShareSender& operator=(const ShareSender&) = delete;

    /// Makes a whole push of a few known paths in one connection, if it is one that has nothing
    /// unusual about it and the server takes it so. Returns whether it was made to its end; if not,
    /// it has to be started in the ordinary way, and whatever this has sent by then is there
    /// already. `identity`: of the server's copy, as it was told last. Throws when the server
    /// cannot be reached or the user ends the run.
    bool SendAtOnce(const RunOrder& order, const ShareOrder& share, const std::string& identity,
                    bool may_lose, CopyPush& copy, TARQ::Backup::RunReport& sent);

    /// Sends the share's paths, and adds to `undone` those that were not. REQUIRES that its push is
    /// started. `may_lose`: a person is asked first when too much would be lost.
    void Send(const RunOrder& order, const ShareOrder& share, bool may_lose, CopyPush& copy,
              TARQ::Backup::RunReport& sent, std::vector<Undone>& undone);

    /// Since the last time.
    Sums TakeSums();
    uint64_t RsyncRuns() const;

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace programs
