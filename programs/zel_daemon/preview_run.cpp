#include "programs/zel_daemon/preview_run.h"

#include <utility>

#include "programs/zel_daemon/shortage.h"

namespace zel_daemon {

namespace {

using programs::FailureKind;
using programs::RunFailure;
using std::chrono::steady_clock;
using TARQ::Backup::RunChange;
using ZEL::PObject;

constexpr size_t kMaxInBatch = 1000;
constexpr std::chrono::milliseconds kGather(50);

PObject Number(uint64_t value) {
    return PObject(static_cast<unsigned long long>(value));
}

PObject Reply() {
    PObject reply;
    reply["result"] = 0;
    return reply;
}

}  // namespace

constexpr std::chrono::seconds PreviewFeed::kPatience;

void PreviewFeed::Begin() {
    const std::lock_guard<std::mutex> lock(mutex_);
    begun_ = true;
}

PreviewFeed::Batch* PreviewFeed::BatchOf(std::unique_lock<std::mutex>& lock,
                                         const std::string& share) {
    const auto begin = steady_clock::now();
    const bool room = moved_.wait_for(lock, kPatience - waited_,
                                      [this] { return bytes_ < kMaxBytes || cancelled_; });
    waited_ += steady_clock::now() - begin;
    if (!room) {
        cancelled_ = true;
    }
    if (cancelled_) {
        return nullptr;
    }
    const Batch* const last = batches_.empty() ? nullptr : &batches_.back();
    if (last == nullptr || last->whole || last->share != share) {
        Batch& batch = batches_.emplace_back();
        batch.reply = Reply();
        batch.reply["share"] = share;
        batch.share = share;
    }
    moved_.notify_all();
    return &batches_.back();
}

void PreviewFeed::Add(const std::string& share, const RunChange& change) {
    std::unique_lock<std::mutex> lock(mutex_);
    if (Batch* const batch = BatchOf(lock, share)) {
        std::string text =
            (change.kind == RunChange::DELETE
                 ? std::string("d ")
                 : (change.damaged ? "x " : "s ") + std::to_string(change.length) + " ") +
            change.path;
        const size_t bytes = text.size() + sizeof(PObject) + sizeof(std::string);
        batch->reply["changes"].asArray().emplace_back(std::move(text));
        batch->bytes += bytes;
        bytes_ += bytes;
        batch->whole = ++batch->changes >= kMaxInBatch;
    }
}

void PreviewFeed::Add(const std::string& share, const programs::PreviewSum& sum) {
    std::unique_lock<std::mutex> lock(mutex_);
    if (Batch* const batch = BatchOf(lock, share)) {
        batch->reply["files"] = Number(sum.files);
        batch->reply["bytes"] = Number(sum.bytes);
        batch->reply["deletions"] = Number(sum.deletions);
        batch->reply["damaged"] = Number(sum.damaged);
        batch->reply["missing"] = sum.missing;
        batch->whole = true;
    }
}

void PreviewFeed::End(const std::optional<RunFailure>& failure) {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (ended_) {
        return;
    }
    PObject& reply = batches_.emplace_back().reply;
    reply = Reply();
    reply["end"] = 1;
    if (failure) {
        const bool too_slow = waited_ >= kPatience;
        reply["sync_status"] = too_slow ? 0 : failure->Status();
        reply["error"] = too_slow ? "what the preview found was not taken for " +
                                        std::to_string(kPatience.count()) + " seconds: it was ended"
                                  : std::string(failure->what());
    }
    ended_ = true;
    moved_.notify_all();
}

PObject PreviewFeed::Next(bool* last) {
    std::unique_lock<std::mutex> lock(mutex_);
    *last = false;
    PObject reply;
    if (!moved_.wait_for(lock, std::chrono::seconds(1), [this] { return !batches_.empty(); })) {
        reply = Reply();
        reply["waiting"] = !begun_;
        return reply;
    }
    // Many changes in a reply cost less than as many replies.
    moved_.wait_for(lock, kGather, [this] {
        return batches_.front().whole || batches_.size() > 1 || ended_ || bytes_ >= kMaxBytes;
    });
    reply.swap(batches_.front().reply);
    bytes_ -= batches_.front().bytes;
    batches_.pop_front();
    *last = ended_ && batches_.empty();
    moved_.notify_all();
    return reply;
}

void PreviewFeed::Leave() {
    Cancel();
    on_leave_();
}

void PreviewFeed::Cancel() {
    {
        const std::lock_guard<std::mutex> lock(mutex_);
        cancelled_ = true;
    }
    moved_.notify_all();
}

PreviewRun::PreviewRun(EventLoop& loop, std::shared_ptr<PreviewFeed> feed,
                       const ZEL::SyncInfo& info, programs::RunOrder order,
                       PreviewListener listener)
    : feed_(std::move(feed)), listener_(std::move(listener)), worker_(loop) {
    worker_.Start<Failed>(
        [this, info, order = std::move(order)] { return Work(info, order); },
        [](const std::string& why) { return RunFailure(FailureKind::kLocal, 0, why); },
        [this](const Failed& failure) { End(failure); });
}

PreviewRun::~PreviewRun() {
    feed_->Cancel();
    worker_.Stop();
    feed_->End(RunFailure(FailureKind::kCancelled, 0, "it was ended"));
}

void PreviewRun::End(const Failed& failure) const {
    if (!failure) {
        listener_.on_success();
    }
    feed_->End(failure);
    const auto on_end = listener_.on_end;  // may end this object
    on_end();
}

PreviewRun::Failed PreviewRun::Work(const ZEL::SyncInfo& info,
                                    const programs::RunOrder& order) const {
    feed_->Begin();
    const std::string problem = RunProblem();
    if (!problem.empty()) {
        return RunFailure(FailureKind::kLocal, 0, problem);
    }
    try {
        programs::TaskRun run(info, feed_->Cancelled());
        programs::Preview(run, order,
                          {[&](const std::string& share, const RunChange& change) {
                               feed_->Add(share, change);
                               listener_.on_change(share, change);
                           },
                           [this](const std::string& share, const programs::PreviewSum& sum) {
                               feed_->Add(share, sum);
                           }});
        return std::nullopt;
    } catch (const RunFailure& failure) {
        return failure;
    }
}

}  // namespace zel_daemon
