#include "programs/common/restore_run.h"

#include <algorithm>
#include <chrono>
#include <sstream>

#include "base/percent.h"
#include "base/text.h"
#include "programs/common/server_session.h"
#include "programs/common/server_status.h"
#include "programs/common/share_path.h"
#include "programs/common/text.h"

namespace programs {

namespace {

using TARQ::Backup::PullOptions;
using TARQ::Backup::RunChange;
using TARQ::Backup::RunOptions;
using TARQ::Backup::RunReport;

// The longest path in a command, which has room for 5 KiB.
constexpr size_t kMaxPathBytes = 4000;
constexpr size_t kMaxModuleBytes = 4096;
constexpr size_t kMaxVersionsBytes = size_t{16} << 20;
// How often files are fetched when they are replaced at the server meanwhile.
constexpr int kTries = 3;

// As docs/server-commands.md has it: what a value of a command may not hold is "%41". A path that
// is too long for a command becomes the nearest folder above that is not.
std::string EncodedPath(const std::string& path) {
    std::string encoded;
    size_t folder = 0;  // of what is encoded, the last whole folder
    for (const char c : path) {
        folder = c == '/' ? encoded.size() : folder;
        encoded += base::PercentEncoded(c, "/.-_");
        if (encoded.size() > kMaxPathBytes) {
            return encoded.substr(0, folder);
        }
    }
    return encoded;
}

std::string PathLine(const std::string& path) {
    return "path=\"" + EncodedPath(path) + "\"";
}

}  // namespace

struct RestoreRun::Impl : ServerSession {
    Impl(const ZEL::SyncInfo& sync_info, const std::atomic<bool>& cancel_flag)
        : ServerSession(sync_info, cancel_flag) {
        goes_on = "the same command brings what is missing";
    }

    std::string Open(const RestoreOrder& order) {
        std::string answer;
        const int status = order.at
                               ? Ask("ZEL_OpenShareAt", order.share,
                                     {"at=\"" + std::to_string(*order.at) + "\"",
                                      PathLine(order.paths.empty() ? "" : order.paths.front())},
                                     answer, {kMaxModuleBytes, kLongAnswer})
                               : Ask("ZEL_OpenShare", order.share, {"access=\"read\""}, answer);
        if (status != kDone) {
            throw order.at && status == kUnknownCommand
                ? KeepsNone()
                : Failed(QuotedShare(order.share) + " cannot be restored", status);
        }
        std::string module = ModuleIn(answer);
        if (module.empty()) {
            throw RunFailure(
                FailureKind::kFailed, 0,
                QuotedShare(order.share) + " cannot be restored: the server names no module");
        }
        return module;
    }

    static RunFailure KeepsNone() {
        return {FailureKind::kRefused, kUnknownCommand,
                "the server is of an earlier version, which has no versions: only the present copy "
                "can be restored"};
    }

    ShareVersions Versions(const std::string& share, const std::string& path) {
        std::string answer;
        const int status = Ask("ZEL_ListVersions", share, {PathLine(path)}, answer,
                               {kMaxVersionsBytes, kLongAnswer});
        if (status != kDone) {
            throw status == kUnknownCommand
                ? KeepsNone()
                : Failed("the versions of " + QuotedShare(share) + " cannot be listed", status);
        }
        ShareVersions listed;
        std::istringstream lines(answer);
        for (std::string line; std::getline(lines, line);) {
            // "1763820000.123456789 12 3456 1763820000.5", the last one or "-"
            std::istringstream words(line);
            ShareVersion version;
            std::string until;
            std::string since;
            if (line == "more") {
                listed.more = true;
            } else if (words >> until >> version.files >> version.bytes >> since) {
                version.until = SecondsOf(until);
                version.since = SecondsOf(since);
                listed.versions.push_back(version);
            }
        }
        return listed;
    }

    static int64_t SecondsOf(const std::string& time) {
        return static_cast<int64_t>(
            base::ParseNumber(time.substr(0, time.find('.')), INT64_MAX).value_or(0));
    }

    // A tree of a past time is there for this restore alone. When that cannot be said the server
    // closes it by itself.
    void Close(const RestoreOrder& order, const std::string& module) {
        if (order.at) {
            std::string ignored;
            patient_until = std::chrono::steady_clock::now() + std::chrono::seconds(1);
            Ask("ZEL_CloseShareAt", order.share, {"module=\"" + module + "\""}, ignored);
            patient_until = {};
        }
    }

    // Each path of a past time is a tree of its own: it costs what is asked for.
    RunReport FetchAll(const RestoreOrder& order, const RestoreListener& listener) {
        if (!order.at || order.paths.size() < 2) {
            return Fetch(order, listener);
        }
        RunReport sum;
        RestoreOrder one = order;
        RestoreListener told = listener;
        for (const std::string& path : order.paths) {
            one.paths = {path};
            const RunReport part = Fetch(one, told);
            told.on_open = nullptr;
            AddFiles(sum, part);
            AddChanges(sum, part);
            AddTraffic(sum, part);
        }
        return sum;
    }

    // What stands at the top of the copy: these paths together are all of it, but for the
    // attributes of the share's own folder.
    std::vector<std::string> TopOf(const RestoreOrder& order, const std::string& module) {
        std::vector<std::string> names;
        RunOptions wishes;
        wishes.module = module;
        wishes.on_change = [&names](const RunChange& entry) {
            const std::string name = RequirePathInShare(entry.path);
            if (!name.empty()) {
                names.push_back(name);
            }
        };
        ZEL::Rsyncer::RsyncTask task;
        With(wishes).InitRsyncTask(task, false);
        task.SetListOnly(true);
        const int status = task.Execute("", order.share, nullptr, "", {"/*/*"});
        if (status != kDone) {
            throw Failed(QuotedShare(order.share) + " cannot be listed", status);
        }
        return names;
    }

    RunReport Fetch(const RestoreOrder& order, const RestoreListener& listener) {
        RunOptions wishes;
        wishes.bandwidth_limit = info.GetMaxBandwidth();
        wishes.dry_run = order.dry_run;
        wishes.module = Open(order);
        if (listener.on_open) {
            listener.on_open();
        }
        wishes.on_progress = listener.on_progress;
        wishes.on_change = listener.on_change;
        wishes.pull = PullOptions{!order.overwrite, order.paths};
        if (order.paths.empty() && order.keep_folder) {
            wishes.pull->paths = TopOf(order, wishes.module);
            if (wishes.pull->paths.empty()) {
                Close(order, wishes.module);
                return {};
            }
        }
        RunReport sum;
        int status = kVanishedFiles;
        for (int i = 0; i < kTries && status == kVanishedFiles && !cancel; ++i) {
            ZEL::Rsyncer::RsyncTask task;
            With(wishes).InitRsyncTask(task, false);
            task.SetCompression(info.UseCompression());
            task.SetSyncACL(true);
            status = task.Execute(order.folder, order.share, nullptr, "", {});
            const uint64_t sent = sum.files_sent + report.files_sent;
            const uint64_t received = sum.bytes_received + report.bytes_received;
            sum = report;
            sum.files_sent = sent;
            sum.bytes_received = received;
        }
        if (status != kDone) {
            const RunFailure failure =
                Failed(QuotedShare(order.share) + " is not restored in full", status);
            Close(order, wishes.module);
            throw failure;
        }
        Close(order, wishes.module);
        return sum;
    }
};

RestoreRun::RestoreRun(const ZEL::SyncInfo& info, const std::atomic<bool>& cancel)
    : impl_(std::make_unique<Impl>(info, cancel)) {}

RestoreRun::~RestoreRun() = default;

void RestoreRun::Connect() {
    impl_->Find();
}

RunReport RestoreRun::Restore(const RestoreOrder& order, const RestoreListener& listener) {
    return impl_->FetchAll(order, listener);
}

ShareVersions RestoreRun::Versions(const std::string& share, const std::string& path) {
    return impl_->Versions(share, path);
}

}  // namespace programs
