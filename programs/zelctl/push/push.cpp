#include "programs/zelctl/push/push.h"

#include "ZEL/zel.h"
#include "programs/common/failure.h"
#include "programs/common/task_run.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/interrupt.h"
#include "programs/zelctl/base/prepare.h"
#include "programs/zelctl/push/progress.h"
#include "programs/zelctl/share/commands.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::RunOrder;
using programs::RunTotals;
using programs::TaskRun;
using TARQ::Backup::RunChange;

// A path that a person names has to be there: it is a slip of the pen, not a deletion.
void CheckPath(const PushOptions& options) {
    for (const std::string& share : options.shares) {
        ZEL::ShareInfo facts;
        if (ZEL::GetShareInfo(share, facts) != 0 ||
            !ZEL::IsPathExist(facts.GetModulePath() + options.path)) {
            throw Failure(FailureKind::kLocal, "share '" + programs::Printable(share) +
                                                   "' has no " + programs::Printable(options.path));
        }
    }
}

// What every command does before it speaks to the server.
ZEL::SyncInfo Prepare(const PushOptions& options) {
    PrepareHost();
    // Of several shares to push those that are fit are pushed; a push of one asks for no password
    // in vain.
    if (options.dry_run || options.shares.size() == 1) {
        CheckShares(options.shares);
    }
    if (options.path != "/") {
        CheckPath(options);
    }
    ZEL::SyncInfo info = options.info ? *options.info : options.connection.ToSyncInfo();
    if (!options.info) {
        info.SetMaxBandwidth(options.bandwidth_limit);
    }
    WatchForInterrupt();
    return info;
}

void Connect(TaskRun& run, const std::vector<std::string>& shares) {
    run.Connect();
    run.CheckPairing(shares);
}

/// Prints what a push would do, and a sum a share.
class ChangeList {
public:
    void Add(const RunChange& change) {
        const std::string path = programs::Printable(change.path);
        if (change.kind == RunChange::SEND) {
            printf("send    %s (%s)\n", path.c_str(), programs::HumanBytes(change.length).c_str());
            ++sends_;
            bytes_ += change.length;
        } else if (change.kind == RunChange::DELETE) {
            printf("delete  %s\n", path.c_str());
            ++deletes_;
        }
    }
    void AddMissing(const std::string& share) {
        printf("%s: the server holds no copy yet; all of it would be sent.\n",
               programs::Printable(share).c_str());
        missing_ = true;
    }
    void Sum(const std::string& share) const {
        if (!missing_) {
            printf("%s: %s (%s) would be sent, %llu deleted.\n", programs::Printable(share).c_str(),
                   programs::Count(sends_, "file").c_str(), programs::HumanBytes(bytes_).c_str(),
                   static_cast<unsigned long long>(deletes_));
        }
    }

private:
    uint64_t sends_ = 0;
    uint64_t bytes_ = 0;
    uint64_t deletes_ = 0;
    bool missing_ = false;
};

void ListChanges(TaskRun& run, const RunOrder& order) {
    for (const programs::ShareOrder& share : order.shares) {
        ChangeList list;
        RunOrder alone = order;
        alone.shares = {share};
        run.List(
            alone, [&](const std::string&, const RunChange& change) { list.Add(change); },
            [&](const std::string& name) { list.AddMissing(name); });
        list.Sum(share.share);
    }
}

}  // namespace

void Push(const PushOptions& options) {
    const ZEL::SyncInfo info = Prepare(options);
    ProgressDisplay display(options.quiet);
    programs::RunListener listener;
    listener.on_progress = [&](const std::string& share, const auto& progress) {
        display.Show(share, progress);
    };
    listener.on_share_done = [&](const std::string& share, const auto& report, double seconds) {
        display.Clear();
        if (!options.quiet) {
            printf("%s: %s\n", programs::Printable(share).c_str(),
                   Summary(report, seconds).c_str());
        }
    };
    listener.on_paired = [&](const std::string& address) {
        if (!options.quiet) {
            printf("Paired with %s.\n", address.c_str());
        }
    };
    TaskRun run(info, Interrupted(), std::move(listener));
    RunOrder order;
    order.task = "push-" + ZEL::GetHostName(35);
    order.excludes = options.excludes;
    for (const std::string& share : options.shares) {
        order.shares.push_back({share, {options.path}});
    }
    if (options.dry_run) {
        Connect(run, options.shares);
        ListChanges(run, order);
        return;
    }
    RunTotals totals;
    const programs::RunResult result = run.Push(order, totals);
    display.Clear();
    if (result.failure) {
        throw *result.failure;
    }
}

void CheckPairing(const ConnectionOptions& connection, const std::vector<std::string>& shares) {
    PushOptions options;
    options.connection = connection;
    options.shares = shares;
    options.dry_run = true;
    TaskRun run(Prepare(options), Interrupted());
    Connect(run, shares);
    puts("The server would take these shares from this client.");
}

}  // namespace zelctl
