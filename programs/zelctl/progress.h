// What a person sees while a share is pushed.
#pragma once

#include <chrono>
#include <string>

#include "tarq/rsync_wrapper.h"

namespace zelctl {

/// A bar that is redrawn in place on a terminal; plain lines, now and then, otherwise. `quiet`:
/// nothing at all.
class ProgressDisplay {
public:
    explicit ProgressDisplay(bool quiet);

    void Show(const std::string& share, const TARQ::Backup::RunProgress& progress);
    /// Takes the bar away, before other lines are written.
    void Clear();

private:
    bool quiet_;
    bool on_terminal_;
    bool drawn_ = false;
    std::chrono::steady_clock::time_point last_;
};

/// "######.........." for a share of 100.
std::string ProgressBar(unsigned int percent);

/// "12 files sent, 1 deleted, 40 compared, 5.0 KiB on the wire, 45 ms"
std::string Summary(const TARQ::Backup::RunReport& report, double seconds);

}  // namespace zelctl
