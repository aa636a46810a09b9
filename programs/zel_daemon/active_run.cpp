#include "programs/zel_daemon/active_run.h"

#include <utility>

#include "ZEL/zel.h"
#include "programs/zel_daemon/shortage.h"

namespace zel_daemon {

namespace {

using programs::RunResult;
using TARQ::Backup::RunProgress;

// A server that has not answered for so long may have moved to another address.
constexpr std::chrono::minutes kOld(10);

std::string FolderOf(const std::string& share) {
    ZEL::ShareInfo facts;
    return ZEL::GetShareInfo(share, facts) == 0 ? facts.GetModulePath() : "";
}

}  // namespace

programs::TaskRun& Connection::For(const programs::RunOrder& order) {
    const auto now = std::chrono::steady_clock::now();
    bool usable = run_ && now - since_ <= kOld;
    for (const programs::ShareOrder& share : order.shares) {
        std::string folder = FolderOf(share.share);
        const auto known = folders_.emplace(share.share, folder).first;
        usable = usable && known->second == folder;
        known->second = std::move(folder);
    }
    if (!usable) {
        since_ = now;
        const auto forward = [this](const std::string& share, const RunProgress& progress) {
            if (on_progress) {
                on_progress(share, progress);
            }
        };
        run_ = std::make_unique<programs::TaskRun>(
            info_, cancel, programs::RunListener{forward, nullptr, nullptr});
    }
    return *run_;
}

void Connection::Answered() {
    since_ = std::chrono::steady_clock::now();
}

ActiveRun::ActiveRun(EventLoop& loop, std::shared_ptr<Connection> connection,
                     programs::RunOrder order, IndexPlace indexes, int64_t moment,
                     const OnProgress& on_progress, const OnEnd& on_end)
    : connection_(std::move(connection)),
      order_(std::move(order)),
      indexes_(std::move(indexes)),
      moment_(moment),
      worker_(loop) {
    worker_.Start<Outcome>([this, on_progress] { return Work(on_progress); },
                           [this](const std::string& why) { return Outcome{NothingDone(why)}; },
                           [this, on_end](const Outcome& outcome) {
                               ended_ = true;
                               on_end(outcome);
                           });
}

ActiveRun::~ActiveRun() {
    if (!ended_) {
        Cancel();
    }
}

ActiveRun::Outcome ActiveRun::Work(const OnProgress& on_progress) {
    connection_->on_progress = [&](const std::string& share, const RunProgress& made) {
        worker_.Tell([on_progress, share, made] { on_progress(share, made); });
    };
    Outcome outcome;
    try {
        const std::string problem = RunProblem();
        if (problem.empty()) {
            RunIndexes indexes(indexes_, order_, moment_,
                               [this] { return connection_->cancel.load(); });
            outcome.result = connection_->For(order_).Push(order_, outcome.totals);
            if (!outcome.result.failure) {
                connection_->Answered();
            }
            outcome.linked = indexes.Ended(outcome.result);
        } else {
            outcome.result = NothingDone(problem);
        }
    } catch (const std::exception& error) {
        outcome.result = NothingDone(error.what());
    }
    connection_->on_progress = nullptr;
    return outcome;
}

RunResult ActiveRun::NothingDone(const std::string& why) const {
    return programs::NothingDone(order_, {programs::FailureKind::kLocal, 0, why});
}

}  // namespace zel_daemon
