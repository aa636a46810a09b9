// The rsync daemon asks here before a connection may touch a share, and tells here how it ended.
#pragma once

namespace zel_server {

/// `zel_server admit-transfer` (pre-xfer exec): exit code 0 lets the connection go on. Only the
/// account that the share belongs to gets in: to write while a push is running, to read, or to ask
/// what a push would change, at any time.
int AdmitTransfer();

/// `zel_server end-transfer` (post-xfer exec): records the outcome of a data run, or removes a
/// command's answer.
int EndTransfer();

}  // namespace zel_server
