#include "programs/zelctl/restore/restore.h"

#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <ctime>
#include <filesystem>

#include "base/make_folder.h"
#include "programs/common/failure.h"
#include "programs/common/restore_run.h"
#include "programs/common/share_path.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/interrupt.h"
#include "programs/zelctl/base/moment.h"
#include "programs/zelctl/base/prepare.h"
#include "programs/zelctl/push/progress.h"
#include "programs/zelctl/restore/confine.h"
#include "programs/zelctl/restore/pushing_tasks.h"
#include "programs/zelctl/restore/source.h"

namespace zelctl {

namespace {

namespace fs = std::filesystem;
using programs::Failure;
using programs::FailureKind;
using programs::Printable;
using TARQ::Backup::RunChange;
using TARQ::Backup::RunReport;

// Whether the folder has something in it already. Throws Failure for what is no folder.
bool IsFilled(const std::string& folder) {
    std::error_code error;
    const fs::file_status status = fs::status(folder, error);
    if (status.type() == fs::file_type::not_found) {
        return false;
    }
    const fs::directory_iterator entries(folder, error);
    if (error) {
        throw Failure(FailureKind::kLocal,
                      "cannot restore into " + Printable(folder) + ": " + error.message());
    }
    return entries != fs::directory_iterator();
}

std::string Summary(const RestoreOptions& options, const RunReport& report, double seconds) {
    const uint64_t kept = options.overwrite ? 0
                                            : report.files_regular -
                                                  std::min(report.files_regular, report.files_sent);
    return programs::Count(report.files_sent, "file") + " restored to " +
           Printable(options.folder) +
           (kept == 0
                ? ""
                : ", " + std::to_string(kept) +
                      " that were there left as they are (--overwrite replaces what differs)") +
           ", " + programs::HumanBytes(report.bytes_sent + report.bytes_received) +
           " on the wire, " + programs::HumanElapsed(seconds);
}

/// What a dry run finds, line by line.
class WouldRestore {
public:
    void operator()(const RunChange& change) {
        if (change.kind == RunChange::SEND) {
            ++files_;
            bytes_ += change.length;
            printf("restore %s (%s)\n", Printable(change.path).c_str(),
                   programs::HumanBytes(change.length).c_str());
        }
    }
    void PrintSum(const std::string& share) const {
        printf("%s: %s (%s) would be restored.\n", Printable(share).c_str(),
               programs::Count(files_, "file").c_str(), programs::HumanBytes(bytes_).c_str());
    }

private:
    uint64_t files_ = 0;
    uint64_t bytes_ = 0;
};

// What the options come to; wrong ones are refused before a password is asked for.
programs::RestoreOrder OrderOf(const RestoreOptions& options) {
    programs::RestoreOrder order;
    order.folder = options.folder;
    order.keep_folder = IsFilled(options.folder);
    if (!options.at.empty()) {
        order.at = ParseMoment(options.at);
        if (!order.at || *order.at > time(nullptr)) {
            throw Failure(FailureKind::kUsage,
                          "--at: '" + Printable(options.at) +
                              "' is no moment 'YYYY-MM-DD HH:MM[:SS]' that has passed");
        }
    }
    order.overwrite = options.overwrite;
    order.dry_run = options.dry_run;
    for (const std::string& path : options.paths) {
        order.paths.push_back(programs::RequirePathInShare(path));
        if (order.paths.back().empty()) {
            throw Failure(FailureKind::kUsage,
                          "the path '" + Printable(path) + "' is the whole share: leave it out");
        }
    }
    return order;
}

void Run(const CopySource& source, programs::RestoreOrder order, const RestoreOptions& options) {
    order.share = source.share;
    WatchForInterrupt();
    programs::RestoreRun run(source.info, Interrupted());
    run.Connect();
    ProgressDisplay display(options.quiet);
    WouldRestore would;
    programs::RestoreListener listener;
    if (options.dry_run) {
        listener.on_change = [&](const RunChange& change) { would(change); };
    } else {
        listener.on_open = [&options] {
            if (!base::MakeFolder(options.folder, 0700)) {
                throw programs::SystemFailure("cannot make the folder " + Printable(options.folder),
                                              FailureKind::kLocal);
            }
            PauseTasksPushing(options.folder);
            WriteOnlyBelow(options.folder);
        };
        if (!options.quiet) {  // rsync tells of each file for that, which costs time
            listener.on_progress = [&](const auto& progress) {
                display.Show(order.share, progress);
            };
        }
    }
    const auto begin = std::chrono::steady_clock::now();
    const RunReport report = run.Restore(order, listener);
    const std::chrono::duration<double> elapsed = std::chrono::steady_clock::now() - begin;
    display.Clear();
    if (options.dry_run) {
        would.PrintSum(order.share);
    } else if (!options.quiet) {
        printf("%s: %s\n", Printable(order.share).c_str(),
               Summary(options, report, elapsed.count()).c_str());
        if (geteuid() != 0) {
            puts(
                "What came back belongs to you: owners, devices and set-user-ID bits are restored "
                "by root alone.");
        }
    }
}

}  // namespace

void Restore(const RestoreOptions& options) {
    PrepareHost();
    const programs::RestoreOrder order = OrderOf(options);
    Run(FindSource(options.task, options.share, options.connection), order, options);
}

void RestoreFrom(const CopySource& source, const RestoreOptions& options) {
    Run(source, OrderOf(options), options);
}

}  // namespace zelctl
