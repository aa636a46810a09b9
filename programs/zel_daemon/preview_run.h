// One preview of a task: a run of a worker that changes nothing, and what it finds on its way to
// who asked.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "ZEL/pobject.h"
#include "programs/common/preview.h"
#include "programs/zel_daemon/loop_worker.h"

namespace zel_daemon {

/// Between the worker that finds changes and the connection that tells them, as the replies of
/// docs/daemon-protocol.md. It holds no more than kMaxBytes: the worker waits while the
/// asker takes nothing, but not for long, because others may wait for the worker.
///
/// Threads: any.
class PreviewFeed {
public:
    /// How long a worker waits for its asker, all waits together.
    static constexpr std::chrono::seconds kPatience{60};
    static constexpr size_t kMaxBytes = size_t{512} * 1024;

    /// `on_leave` is called, on any thread, when the asker goes.
    explicit PreviewFeed(std::function<void()> on_leave) : on_leave_(std::move(on_leave)) {}

    // ---- The worker's side ----

    void Begin();
    void Add(const std::string& share, const TARQ::Backup::RunChange& change);
    void Add(const std::string& share, const programs::PreviewSum& sum);
    /// The last word: of a failure, or that all is told. Nothing is said after it.
    void End(const std::optional<programs::RunFailure>& failure);
    /// Nobody wants to know any more: the run is to end.
    const std::atomic<bool>& Cancelled() const { return cancelled_; }

    // ---- The asker's side ----

    /// The next reply; after a second one that tells how it stands. `last`: none comes after it.
    ZEL::PObject Next(bool* last);
    /// The asker has gone.
    void Leave();

    /// Ends the run, and what waits for it.
    void Cancel();

private:
    struct Batch {
        ZEL::PObject reply;
        std::string share;
        size_t changes = 0;
        size_t bytes = 0;
        bool whole = false;  // takes no more
    };
    // What takes that which is found of this share; waits for room. Null: nobody wants it.
    Batch* BatchOf(std::unique_lock<std::mutex>& lock, const std::string& share);

    const std::function<void()> on_leave_;
    std::atomic<bool> cancelled_{false};
    std::mutex mutex_;  // over all that follows
    std::condition_variable moved_;
    std::deque<Batch> batches_;
    size_t bytes_ = 0;  // in them
    bool begun_ = false;
    bool ended_ = false;
    std::chrono::steady_clock::duration waited_{0};
};

/// What becomes of a preview. None is called once its PreviewRun is gone.
struct PreviewListener {
    /// On the run's thread, for what the asker is told of.
    programs::ChangeHandler on_change;
    /// On the loop's thread, before the asker hears that all is told.
    std::function<void()> on_success;
    /// On the loop's thread, after all else; may end the PreviewRun.
    std::function<void()> on_end;
};

/// Threads: the loop's.
class PreviewRun {
public:
    /// Starts it; without a thread to be had it ends as failed, after this.
    PreviewRun(EventLoop& loop, std::shared_ptr<PreviewFeed> feed, const ZEL::SyncInfo& info,
               programs::RunOrder order, PreviewListener listener);
    /// Cancels and waits for the end.
    ~PreviewRun();
    PreviewRun(const PreviewRun&) = delete;
    PreviewRun& operator=(const PreviewRun&) = delete;

private:
    using Failed = std::optional<programs::RunFailure>;

    Failed Work(const ZEL::SyncInfo& info, const programs::RunOrder& order) const;
    void End(const Failed& failure) const;

    std::shared_ptr<PreviewFeed> feed_;
    const PreviewListener listener_;
    LoopWorker worker_;
};

}  // namespace zel_daemon
