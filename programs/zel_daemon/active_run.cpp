#include "programs/zel_daemon/active_run.h"

#include <system_error>
#include <utility>

#include "ZEL/zel.h"
#include "programs/zel_daemon/shortage.h"

namespace zel_daemon {

namespace {

using programs::RunTotals;
using programs::Verdict;
using TARQ::Backup::RunProgress;

// A server may have moved to another address by then.
constexpr std::chrono::minutes kOld(10);

std::string FolderOf(const std::string& share) {
    ZEL::ShareInfo facts;
    return ZEL::GetShareInfo(share, facts) == 0 ? facts.GetModulePath() : "";
}

}  // namespace

Connection::Connection(const ZEL::SyncInfo& info)
    : run(info, cancel,
          {[this](const std::string& share, const RunProgress& progress) {
               if (on_progress) {
                   on_progress(share, progress);
               }
           },
           nullptr, nullptr}) {}

bool Connection::Reusable(const std::list<std::string>& shares) const {
    if (!ready_ || cancel || std::chrono::steady_clock::now() - since_ > kOld) {
        return false;
    }
    for (const std::string& share : shares) {
        const auto known = folders_.find(share);
        if (known == folders_.end() || known->second != FolderOf(share)) {
            return false;
        }
    }
    return true;
}

Verdict Connection::Ensure(const std::list<std::string>& shares) {
    if (ready_) {
        return {};
    }
    Verdict verdict = run.Connect();
    if (verdict.Ok()) {
        verdict = run.CheckPairing({shares.begin(), shares.end()});
    }
    if (verdict.Ok()) {
        for (const std::string& share : shares) {
            folders_[share] = FolderOf(share);
        }
        ready_ = true;
        since_ = std::chrono::steady_clock::now();
    }
    return verdict;
}

ActiveRun::ActiveRun(EventLoop& loop, std::shared_ptr<Connection> connection, RunPlan plan,
                     OnProgress on_progress, OnEnd on_end)
    : connection_(std::move(connection)), plan_(std::move(plan)) {
    try {
        thread_ =
            std::thread([this, &loop, on_progress, on_end] { Work(loop, on_progress, on_end); });
    } catch (const std::system_error& error) {
        End(loop, on_end, {programs::Trouble::kLocal, 0, ReasonOf(error.code().value())}, {});
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
    Verdict verdict;
    RunTotals totals;
    try {
        verdict = Run(totals);
    } catch (const std::exception& error) {
        verdict = {programs::Trouble::kLocal, 0, error.what()};
    }
    connection_->on_progress = nullptr;
    End(loop, on_end, verdict, totals);
}

void ActiveRun::End(EventLoop& loop, const OnEnd& on_end, const Verdict& verdict,
                    const RunTotals& totals) {
    loop.Post([this, alive = alive_, on_end, verdict, totals] {
        if (*alive) {
            ended_ = true;
            on_end(verdict, totals);
        }
    });
}

Verdict ActiveRun::Run(RunTotals& totals) {
    std::list<std::string> shares;
    for (const programs::ShareOrder& share : plan_.order.shares) {
        shares.push_back(share.share);
        std::string problem = programs::ShareProblem(share.share);
        if (!problem.empty()) {
            return {programs::Trouble::kLocal, 0, std::move(problem)};
        }
    }
    Verdict verdict = connection_->Ensure(shares);
    return verdict.Ok() ? connection_->run.Push(plan_.order, totals) : verdict;
}

}  // namespace zel_daemon
