// Checks that the rsync daemon runs before and after a connection uses a share.
#pragma once

namespace zel_server {

/// `zel_server admit-transfer` (pre-xfer exec): exit code 0 admits the connection. Only the account
/// that owns the share is admitted: to write while a push is running, to read, or to do a dry run
/// at any time.
int AdmitTransfer();

/// `zel_server end-transfer` (post-xfer exec): records the outcome of a transfer, or removes the
/// answer to a command.
int EndTransfer();

}  // namespace zel_server
