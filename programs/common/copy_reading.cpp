#include "programs/common/copy_reading.h"

#include "programs/common/mounts_below.h"
#include "programs/common/server_status.h"

namespace programs {

namespace {

using TARQ::Backup::RunChange;
using TARQ::Backup::RunOptions;

// rsync: some files could not be read or compared.
constexpr int kSomeFiles = 23;

}  // namespace

std::optional<std::string> OpenForReading(ServerSession& session, const std::string& share,
                                          const char* access) {
    std::string answer;
    const int status =
        session.Ask("ZEL_OpenShare", share, {std::string("access=\"") + access + "\""}, answer);
    switch (status) {
        case kDone:
            break;
        case kNoSuchShare:
            return std::nullopt;
        case kUnknownCommand:
        case kUnsupportedCommand:
        case kAccepted:
        case kPassedThrough:
            return "";
        default:
            throw session.Failed(QuotedShare(share) + " cannot be compared", status);
    }
    std::string module = session.ModuleIn(answer);
    if (module.empty()) {
        throw RunFailure(FailureKind::kFailed, 0,
                         QuotedShare(share) + " cannot be compared: the server names no module");
    }
    return module;
}

void ListCopy(ServerSession& session, const std::string& share,
              const std::function<void(const RunChange&)>& on_file) {
    std::optional<std::string> module;
    try {
        module = OpenForReading(session, share, "read");
    } catch (const RunFailure&) {
        return;
    }
    if (!module || module->empty()) {
        return;
    }
    RunOptions wishes;
    wishes.on_change = on_file;
    ZEL::Rsyncer::RsyncTask task;
    session.With(wishes).InitRsyncTask(task, false);
    task.SetListOnly(true);
    task.Execute("", *module, nullptr, "", {});
}

void ListShare(ServerSession& session, const RunOrder& order, const ShareOrder& share,
               const ChangeHandler& on_change,
               const std::function<void(const std::string&)>& on_missing) {
    const auto module = OpenForReading(session, share.share, "compare");
    if (!module) {
        on_missing(share.share);
        return;
    }
    ZEL::ShareInfo facts;
    std::vector<std::string> away;
    if (session.rsyncer.GetShareInfo(share.share, facts) == 0) {
        Noted([&] { away = MissingMounts(share.share, facts.GetModulePath()); });
    }
    if (order.background && module->empty()) {
        throw RunFailure(FailureKind::kRefused, kUnknownCommand,
                         "the server is of an earlier version and offers no reading");
    }
    static const std::vector<std::string> whole = {kWholeShare};
    for (const std::string& path : share.files.empty() ? share.paths : whole) {
        RunOptions wishes;
        wishes.dry_run = true;
        wishes.by_content = order.by_content;
        wishes.files = share.files;
        wishes.background = order.background;
        wishes.keep_versions = true;  // their folder at the server is no difference
        wishes.module = *module;
        wishes.on_change = [&](const RunChange& change) { on_change(share.share, change); };
        int status = 0;
        const int ran = session.With(wishes).RunSync(order.task_id, share.share, path,
                                                     ToList(Without(away, order.excludes)), status);
        if (ran == 0 && status != 0 &&
            session.report.cause == TARQ::Backup::RunCause::UNKNOWN_MODULE) {
            on_missing(share.share);
            return;
        }
        // Of files that were found by name some may be gone or out of reach by now.
        const bool some = !share.files.empty() && status == kSomeFiles && !session.cancel;
        if (ran != 0 || (status != 0 && status != kVanishedFiles && !some)) {
            throw session.Failed(QuotedShare(share.share) + " cannot be compared", status);
        }
    }
}

}  // namespace programs
