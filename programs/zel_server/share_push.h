// A push into a share at the server: how it starts, and how it ends.
//
// It starts in one of two ways. ZEL_SyncStart opens the share's module for the data runs that
// follow, until ZEL_SyncFinish. A push in one connection brings the lines of that command along
// with its one data run: it is admitted only where client and server agree exactly about the copy,
// ends with that run, and is complete when that has exit status 0.
//
// Called with the registry's lock held, but for AwaitEarlierPushes().
#pragma once

#include <string>

#include "programs/zel_server/answers.h"
#include "programs/zel_server/request.h"
#include "programs/zel_server/share_module.h"

namespace zel_server {

/// Whether this client and account may push at all: kDone, or why not.
int RequirePaired(const Request& request);

/// Before a start of either kind: waits, for seconds at most, until the earlier pushes have ended
/// of which the client knows that they have, and for runs that still write what it wants to go on
/// with. Nobody else waits: the registry's lock is not held.
void AwaitEarlierPushes(const Request& start);

/// ZEL_SyncStart.
Answer StartSync(const Request& request);

/// ZEL_SyncFinish of a share.
Answer FinishShare(const Request& request, const std::string& share, bool completed);

/// Starts a push that ends with the connection of `process`, and leads that to the copy. `request`:
/// a ZEL_SyncStart that says what the client expects. A status other than kDone: it is not
/// admitted; then nothing was changed, unless a file could not be written or some of the moves that
/// it tells could not be made.
int BeginInConnection(const Request& request, const std::string& process);

/// Ends such a push with the exit status of its rsync, "" if there is none. `wrote`: its run was
/// admitted. False when that cannot be recorded.
bool EndInConnection(const OpenModule& push, const std::string& exit_status, bool wrote);

}  // namespace zel_server
