// Progress output during a push.
#pragma once

#include <chrono>
#include <string>

#include "programs/zelctl/base/live_block.h"
#include "tarq/rsync_wrapper.h"

namespace zelctl {

/// A line that is redrawn in place on a terminal; elsewhere a plain line from time to time.
/// `quiet`: no output.
class ProgressDisplay {
public:
    explicit ProgressDisplay(bool quiet) : quiet_(quiet) {}

    void Show(const std::string& share, const TARQ::Backup::RunProgress& progress);
    /// Removes the line, so that other output can be written.
    void Clear() { block_.Clear(); }

private:
    const bool quiet_;
    LiveBlock block_;
    std::chrono::steady_clock::time_point last_line_ = std::chrono::steady_clock::now();
};

/// "12 files sent, 1 deleted, 40 compared, 5.0 KiB on the wire, 45 ms"
std::string Summary(const TARQ::Backup::RunReport& report, double seconds);

}  // namespace zelctl
