#include "programs/common/task_run.h"

#include <algorithm>
#include <chrono>
#include <map>
#include <optional>
#include <utility>

#include "programs/common/beacon.h"
#include "programs/common/copy_push.h"
#include "programs/common/copy_reading.h"
#include "programs/common/host.h"
#include "programs/common/open_share.h"
#include "programs/common/server_session.h"
#include "programs/common/server_status.h"
#include "programs/common/share_notes.h"
#include "programs/common/share_sender.h"
#include "programs/common/share_start.h"
#include "programs/common/text.h"

namespace programs {

namespace {

using std::chrono::steady_clock;
using TARQ::Backup::RunReport;

// Whether `step` succeeds; otherwise the whole order of the share is added to `undone`.
template <typename Step>
bool Succeeds(const ShareOrder& share, std::vector<Undone>& undone, Step step) {
    try {
        step();
        return true;
    } catch (const RunFailure& failure) {
        undone.push_back({share.share, share.paths, failure});
        return false;
    }
}

}  // namespace

struct TaskRun::Impl : ServerSession {
    Impl(const ZEL::SyncInfo& sync_info, const std::atomic<bool>& cancel_flag, RunListener told)
        : ServerSession(sync_info, cancel_flag), listener(std::move(told)) {}

    // A refusal of the report does not end the run, but a missing answer does: each of the
    // following commands and copies would run into the same time-out.
    void Announce(const std::string& task) {
        int status = 0;
        With().SendBeacon(task, status);
        if (Silent()) {
            throw Failed("the server does not answer", report.status);
        }
    }

    // Throws only before the first share is started.
    void PushShares(const RunOrder& order, const ShareOrders& shares, RunTotals& totals,
                    std::vector<Undone>& undone) {
        if (!connected) {
            Find();
        }
        if (order.announce) {
            Announce(order.task);
        }
        Beacon beacon(rsyncer.GetSyncInfo(), order.task);
        for (auto share = shares.begin(); share != shares.end();) {
            const size_t before = undone.size();
            beacon.SetShare((*share)->share);
            PushShare(order, **share, totals, undone);
            ++share;
            if (undone.size() == before) {
                continue;
            }
            RunFailure end = undone.back().failure;
            if (end.reach == Reach::kRun || !heard) {
                end.reach = Reach::kRun;
                LeaveUndone({share, shares.end()}, end, false, undone);
                break;
            }
        }
        const bool announced = beacon.Stop() || order.announce;
        totals.rsync_runs += sender.RsyncRuns();
        if (announced && heard) {
            int ignored = 0;
            LastWord("task", order.task, ignored);
        }
    }

    // Adds to `undone` what the server has not accepted.
    void PushShare(const RunOrder& order, const ShareOrder& asked, RunTotals& totals,
                   std::vector<Undone>& undone) {
        // Starting a push makes the copy's folder, after which nobody could tell that there was
        // none.
        const bool may_lose =
            asked.brake.MustLook() && (asked.brake.files || MayHaveCopy(asked.share));
        std::optional<CopyPush> copy;
        RunReport sent;
        auto begin = steady_clock::now();
        bool at_once = false;  // start, data and end in one connection
        const auto start = [&] {
            Noted([&] { copy.emplace(asked.share, asked.paths); });
            pushes[asked.share] = copy->Mark();
            at_once =
                sender.SendAtOnce(order, asked, identities[asked.share], may_lose, *copy, sent);
            if (!at_once) {
                StartShare(*this, asked.share, *copy, listener.on_paired);
                identities[asked.share] = copy->Identity();
                begin = steady_clock::now();
            }
        };
        if (!Succeeds(asked, undone, start)) {
            heard = !Silent();
            if (copy && copy->HasEntered()) {
                AddTo(totals, sent);
                copy->Ended(false, false);
            }
            return;
        }
        if (at_once) {
            AddTo(totals, sent);
            copy->Ended(true, false);
            Done(asked.share, sent, begin);
            return;
        }
        ShareOrder share = asked;
        if (copy->MustCompare() && order.may_widen) {
            share.paths = {kWholeShare};
            share.rest_waits = false;
        }
        share.brake.is_known = !copy->MustCompare();
        if (!share.brake.is_known) {  // it may hold anything
            share.brake.files.reset();
            share.brake.at_most.reset();
        }
        const size_t undone_before = undone.size();
        Succeeds(share, undone, [&] {
            SendShareKey(*this, share.share);
            sender.Send(order, share, may_lose || (asked.brake.files && share.brake.MustLook()),
                        *copy, sent, undone);
        });
        AddTo(totals, sent);
        const bool completed = undone.size() == undone_before;
        heard = completed || !Silent();
        const bool confirmed =
            heard &&
            Succeeds(share, undone, [&] { Finish(share.share, completed, share.rest_waits); }) &&
            completed;
        const bool whole =
            std::find(share.paths.begin(), share.paths.end(), kWholeShare) != share.paths.end();
        copy->Ended(confirmed && !share.rest_waits, whole);
        if (confirmed) {
            Done(share.share, sent, begin);
        }
    }

    static void AddTo(RunTotals& totals, const RunReport& sent) {
        totals.files_sent += sent.files_sent;
        totals.files_deleted += sent.files_deleted;
        totals.bytes_sent += sent.bytes_sent + sent.bytes_received;
    }

    void Done(const std::string& share, const RunReport& sent,
              steady_clock::time_point begin) const {
        if (listener.on_share_done) {
            const std::chrono::duration<double> elapsed = steady_clock::now() - begin;
            listener.on_share_done(share, sent, elapsed.count());
        }
    }

    // Whether the server may have a copy of the share.
    bool MayHaveCopy(const std::string& share) {
        try {
            return !ReadShareNotes(share).copies.empty() || OpenForReading(*this, share, "compare");
        } catch (const Failure&) {
            return true;  // what comes next fails as well, or tells
        }
    }

    void Finish(const std::string& share, bool completed, bool rest_waits) {
        int status = 0;
        const int sent = LastWord(completed && !rest_waits ? "share" : "abort", share, status);
        const bool confirmed = sent == 0 && status == kDone;
        heard = (!cancel || confirmed) && !Silent();
        if (completed && !confirmed) {
            throw Failed("the server does not confirm " + QuotedShare(share), status,
                         ReachOfCommand(status));
        }
    }

    RunListener listener;
    ShareSender sender{*this, listener};
    std::map<std::string, std::string> pushes;      // their marks, by share
    std::map<std::string, std::string> identities;  // of the copies, as the server told them
    bool heard = true;  // false: the server did not answer, so no final report is sent
};

TaskRun::TaskRun(const ZEL::SyncInfo& info, const std::atomic<bool>& cancel, RunListener listener)
    : impl_(std::make_unique<Impl>(info, cancel, std::move(listener))) {}

TaskRun::~TaskRun() = default;

void TaskRun::Connect() {
    impl_->Find();
}

void TaskRun::CheckPairing(const std::vector<std::string>& shares) {
    PairShares(*impl_, true, shares);
}

RunResult TaskRun::Push(const RunOrder& order, RunTotals& totals) {
    impl_->sender.TakeSums();
    impl_->heard = true;
    impl_->pushes.clear();
    RunResult result;
    ShareOrders ready;
    for (const ShareOrder& share : order.shares) {
        if (Succeeds(share, result.undone, [&] { CheckShare(share.share); })) {
            ready.push_back(&share);
        }
    }
    // The server is not contacted when no share can be pushed.
    if (!ready.empty()) {
        try {
            impl_->PushShares(order, ready, totals, result.undone);
        } catch (const RunFailure& failure) {
            LeaveUndone(ready, failure, true, result.undone);
        }
    }
    result.failure = Sum(result.undone);
    ShareSender::Sums sums = impl_->sender.TakeSums();
    result.copies = std::move(sums.copies);
    result.moved = std::move(sums.moved);
    result.pushes = std::move(impl_->pushes);
    return result;
}

void TaskRun::List(const RunOrder& order, const ChangeHandler& on_change,
                   const std::function<void(const std::string& share)>& on_missing) {
    for (const ShareOrder& share : order.shares) {
        ListShare(*impl_, order, share, on_change, on_missing);
    }
}

}  // namespace programs
