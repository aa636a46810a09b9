#include "programs/zel_daemon/active_run.h"

#include <system_error>
#include <utility>

#include "ZEL/zel.h"
#include "programs/common/host.h"
#include "programs/zel_daemon/shortage.h"

namespace zel_daemon {

namespace {

using programs::RunResult;
using TARQ::Backup::RunProgress;

// A server that has not answered for so long may have moved to another address.
constexpr std::chrono::minutes kOld(10);
// What a run needs: the ends of pipes to two rsyncs, and files that are read on the way.
constexpr unsigned int kDescriptors = 16;

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
      moment_(moment) {
    try {
        thread_ =
            std::thread([this, &loop, on_progress, on_end] { Work(loop, on_progress, on_end); });
    } catch (const std::system_error& error) {
        End(loop, on_end, {NothingDone(ReasonOf(error.code().value()))});
    }
}

ActiveRun::~ActiveRun() {
    *alive_ = false;
    if (!ended_) {
        Cancel();
    }
    if (thread_.joinable()) {
        thread_.join();
    }
}

void ActiveRun::Work(EventLoop& loop, const OnProgress& on_progress, const OnEnd& on_end) {
    connection_->on_progress = [&](const std::string& share, const RunProgress& made) {
        loop.Post([alive = alive_, on_progress, share, made] {
            if (*alive) {
                on_progress(share, made);
            }
        });
    };
    Outcome outcome;
    try {
        // In the middle of a run their lack would look like a volume that is not mounted, or worse.
        const int lack = LackOfDescriptors(kDescriptors);
        // What lies in /tmp may have been cleaned away since the start.
        const std::string unprepared = lack != 0 ? ReasonOf(lack) : programs::PrepareHost();
        if (unprepared.empty()) {
            RunIndexes indexes(indexes_, order_, moment_,
                               [this] { return connection_->cancel.load(); });
            outcome.result = connection_->For(order_).Push(order_, outcome.totals);
            if (!outcome.result.failure) {
                connection_->Answered();
            }
            outcome.linked = indexes.Ended(outcome.result);
        } else {
            outcome.result = NothingDone(unprepared);
        }
    } catch (const std::exception& error) {
        outcome.result = NothingDone(error.what());
    }
    connection_->on_progress = nullptr;
    End(loop, on_end, outcome);
}

RunResult ActiveRun::NothingDone(const std::string& why) const {
    return programs::NothingDone(order_, {programs::FailureKind::kLocal, 0, why});
}

void ActiveRun::End(EventLoop& loop, const OnEnd& on_end, const Outcome& outcome) {
    loop.Post([this, alive = alive_, on_end, outcome] {
        if (*alive) {
            ended_ = true;
            on_end(outcome);
        }
    });
}

}  // namespace zel_daemon
