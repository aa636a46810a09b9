// Words for what the system had no more of.
#pragma once

#include <string>

namespace zel_daemon {

/// What the error number `error` says, with the limit to raise when it is one that the daemon has
/// reached. EAGAIN is that of a thread or process that could not be started.
std::string ReasonOf(int error);

/// Why no run can be begun at this moment; empty: one can. In the middle of it a lack of
/// descriptors would look like a volume that is not mounted, or worse.
std::string RunProblem();

/// What programs::ShareProblem() says, unless the look-up itself lacks descriptors: that says
/// nothing of the share, and must not be taken for a volume that is away.
std::string ShareProblem(const std::string& share);

}  // namespace zel_daemon
