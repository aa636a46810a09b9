#include "programs/zelctl/progress.h"

#include <unistd.h>

#include <cstdio>

#include "programs/common/text.h"

namespace zelctl {

namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::steady_clock;

constexpr int kBarWidth = 24;
constexpr milliseconds kRedrawEvery(100);
constexpr seconds kLineEvery(10);

std::string TimeLeft(const TARQ::Backup::RunProgress& progress) {
    if (!progress.totals_final || progress.percent == 0 || progress.bytes_per_second == 0) {
        return "";
    }
    const uint64_t left = progress.bytes_done / progress.percent * (100 - progress.percent);
    return ", " + programs::HumanDuration(left / progress.bytes_per_second) + " left";
}

}  // namespace

ProgressDisplay::ProgressDisplay(bool quiet)
    : quiet_(quiet), on_terminal_(isatty(STDOUT_FILENO) != 0) {}

void ProgressDisplay::Show(const std::string& share, const TARQ::Backup::RunProgress& progress) {
    const auto now = steady_clock::now();
    const bool first = last_ == steady_clock::time_point();
    if (quiet_ || (!first && now - last_ < (on_terminal_ ? milliseconds(kRedrawEvery)
                                                         : milliseconds(kLineEvery)))) {
        return;
    }
    last_ = now;
    const std::string done = programs::HumanBytes(progress.bytes_done);
    const std::string rate = programs::HumanBytes(progress.bytes_per_second);
    if (on_terminal_) {
        printf("\r%s [%s] %3u%%  %s, %s/s%s\033[K", programs::Printable(share).c_str(),
               ProgressBar(progress.percent).c_str(), progress.percent, done.c_str(), rate.c_str(),
               TimeLeft(progress).c_str());
        drawn_ = true;
    } else if (!first) {
        printf("%s: %u%%, %s, %s/s%s\n", programs::Printable(share).c_str(), progress.percent,
               done.c_str(), rate.c_str(), TimeLeft(progress).c_str());
    }
    fflush(stdout);
}

void ProgressDisplay::Clear() {
    if (drawn_) {
        fputs("\r\033[K", stdout);
        fflush(stdout);
        drawn_ = false;
    }
}

std::string ProgressBar(unsigned int percent) {
    const int filled = static_cast<int>(percent) * kBarWidth / 100;
    return std::string(static_cast<size_t>(filled), '#') +
           std::string(static_cast<size_t>(kBarWidth - filled), '.');
}

std::string Summary(const TARQ::Backup::RunReport& report, double elapsed) {
    return programs::Count(report.files_sent, "file") + " sent, " +
           std::to_string(report.files_deleted) + " deleted, " +
           std::to_string(report.files_total) + " compared, " +
           programs::HumanBytes(report.bytes_sent + report.bytes_received) + " on the wire, " +
           programs::HumanElapsed(elapsed);
}

}  // namespace zelctl
