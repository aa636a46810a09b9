#include "programs/zelctl/push/progress.h"

#include <cstdio>

#include "programs/common/run_progress.h"
#include "programs/common/text.h"

namespace zelctl {

namespace {

constexpr std::chrono::seconds kLineEvery(10);

}  // namespace

void ProgressDisplay::Show(const std::string& share, const TARQ::Backup::RunProgress& progress) {
    if (quiet_) {
        return;
    }
    if (LiveBlock::Possible()) {
        block_.Draw({programs::ProgressLine(share, progress, LiveBlock::Columns())});
        return;
    }
    const auto now = std::chrono::steady_clock::now();
    if (now - last_line_ >= kLineEvery) {
        last_line_ = now;
        printf("%s: %s\n", programs::Printable(share).c_str(),
               programs::ProgressWords(progress).c_str());
        fflush(stdout);
    }
}

std::string Summary(const TARQ::Backup::RunReport& report, double elapsed) {
    return programs::Count(report.files_sent, "file") + " sent, " +
           std::to_string(report.files_deleted) + " deleted, " +
           std::to_string(report.files_total) + " compared, " +
           programs::HumanBytes(report.bytes_sent + report.bytes_received) + " on the wire, " +
           programs::HumanElapsed(elapsed);
}

}  // namespace zelctl
