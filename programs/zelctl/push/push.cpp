#include "programs/zelctl/push/push.h"

#include <unistd.h>

#include <iterator>
#include <utility>

#include "ZEL/zel.h"
#include "programs/common/failure.h"
#include "programs/common/preview.h"
#include "programs/common/task_fields.h"
#include "programs/common/task_run.h"
#include "programs/common/terminal.h"
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

// A path given on the command line must exist: otherwise it is a typing error, not a deletion.
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

// Common preparation of all commands, before the server is contacted.
ZEL::SyncInfo Prepare(const PushOptions& options) {
    PrepareHost();
    // With several shares, problems of one do not keep the others from being pushed. For a single
    // one they are found here, before anybody is asked for a password.
    if (options.dry_run || options.shares.size() == 1) {
        CheckShares(options.shares);
    }
    if (options.path != "/") {
        CheckPath(options);
    }
    ZEL::SyncInfo info = options.connection.ToSyncInfo();
    WatchForInterrupt();
    return info;
}

// How much a push may lose without being asked. What the copy holds is not known here.
programs::Brake BrakeOf(const PushOptions& options) {
    const auto& said = std::as_const(options.connection.said);
    const auto& settings = said.hasMember("brake") ? said : programs::DefaultSettings();
    programs::Brake brake;
    brake.percent = options.confirmed ? 0 : settings["brake"].asUInt32();
    return brake;
}

// Asks about each share that waits for a person, and pushes those that may go on.
programs::RunResult AskAndPush(TaskRun& run, RunOrder order, const programs::RunResult& first,
                               RunTotals& totals) {
    programs::RunResult result;
    std::vector<programs::ShareOrder> allowed;
    for (const programs::Undone& undone : first.undone) {
        const std::optional<programs::Question>& question = undone.failure.question;
        if (question && isatty(STDIN_FILENO) != 0 && !Interrupted()) {
            for (const std::string& line : question->list) {
                puts(line.c_str());
            }
            if (programs::Confirm(programs::Printable(question->text) + ". Go on?")) {
                programs::ShareOrder& again = allowed.emplace_back();
                again.share = undone.share;
                again.paths = undone.paths;
                again.brake = order.shares.front().brake;
                again.consent = {question->reason, question->amount};
                continue;
            }
        }
        result.undone.push_back(undone);
    }
    if (!allowed.empty()) {
        order.shares = std::move(allowed);
        programs::RunResult second = run.Push(order, totals);
        std::move(second.undone.begin(), second.undone.end(), std::back_inserter(result.undone));
    }
    result.failure = programs::Sum(result.undone);
    return result;
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
    const ZEL::PObject& said = options.connection.said;
    order.bandwidth = programs::Bandwidth::Of(said["max_bandwidth"].asUInt32(),
                                              said["bandwidth_windows"].asString());
    order.may_widen = false;  // a person who names a path means that path alone
    for (const std::string& share : options.shares) {
        order.shares.push_back({share, {options.path}});
        order.shares.back().brake = BrakeOf(options);
    }
    if (options.dry_run) {
        programs::Preview(run, order,
                          {[](const std::string&, const TARQ::Backup::RunChange& change) {
                               puts(programs::ChangeLine(change).c_str());
                           },
                           [](const std::string& share, const programs::PreviewSum& sum) {
                               puts(programs::SumLine(share, sum).c_str());
                           }});
        return;
    }
    RunTotals totals;
    programs::RunResult result = run.Push(order, totals);
    display.Clear();
    if (result.failure) {
        result = AskAndPush(run, order, result, totals);
        display.Clear();
    }
    if (result.failure && result.failure->question) {
        throw Failure(FailureKind::kConfirm,
                      result.failure->what() + std::string("; nothing of it was done: "
                                                           "--dry-run lists it, --confirm lets it "
                                                           "go"));
    }
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
    run.Connect();
    run.CheckPairing(shares);
    puts("The server would take these shares from this client.");
}

}  // namespace zelctl
