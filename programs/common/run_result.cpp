#include "programs/common/run_result.h"

#include <algorithm>
#include <iterator>

#include "programs/common/server_status.h"
#include "programs/common/text.h"
#include "tarq/rsync_wrapper.h"

namespace programs {

namespace {

// Longer failure texts are cut, as messages and rows of the history are limited.
constexpr size_t kMaxToldBytes = size_t{6} * 1024;
constexpr size_t kMaxDetailBytes = size_t{16} * 1024;

}  // namespace

FailureKind KindOf(int status) {
    if (status == kNotConfirmed) {
        return FailureKind::kConfirm;
    }
    if (status == kNothingSent || status == kKeyFileFailed) {
        return FailureKind::kLocal;
    }
    return status < kFirstServerStatus && status != TARQ::Backup::STATUS_AUTHENTICATION
               ? FailureKind::kFailed
               : FailureKind::kRefused;
}

RunFailure::RunFailure(const Question& asked)
    : Failure(FailureKind::kConfirm, asked.text, kNotConfirmed),
      reach(Reach::kShare),
      question(asked) {}

void LeaveUndone(const ShareOrders& shares, const RunFailure& failure, bool is_first,
                 std::vector<Undone>& undone) {
    for (const ShareOrder* share : shares) {
        undone.push_back({share->share, share->paths, failure, is_first && share == shares[0]});
    }
}

std::optional<RunFailure> Sum(const std::vector<Undone>& undone) {
    std::vector<const RunFailure*> failures;
    for (const Undone& item : undone) {
        if (item.tried) {
            failures.push_back(&item.failure);
        }
    }
    if (failures.empty()) {
        return {};
    }
    const size_t not_tried = undone.size() - failures.size();
    const auto ended = std::find_if(failures.begin(), failures.end(), [](const RunFailure* item) {
        return item->reach == Reach::kRun;
    });
    if (ended != failures.end()) {
        std::rotate(failures.begin(), ended, std::next(ended));
    }
    const RunFailure& first = *failures.front();
    std::string text = first.what();
    size_t told = 1;
    for (; told < failures.size() && text.size() < kMaxToldBytes; ++told) {
        text += "; " + std::string(failures[told]->what());
    }
    if (told < failures.size()) {
        text += "; and " + std::to_string(failures.size() - told) + " more like these";
    }
    if (not_tried > 0 && first.Kind() != FailureKind::kCancelled && failures.size() > 1) {
        text += "; " + Count(not_tried, "share") + " not tried";
    }
    std::string details = first.details;
    for (size_t i = 1; i < failures.size() && !failures[i]->details.empty(); ++i) {
        if (details.size() + failures[i]->details.size() >= kMaxDetailBytes) {
            break;
        }
        details += (details.empty() ? "" : "\n") + failures[i]->details;
    }
    RunFailure sum(first.Kind(), first.Status(), text, first.reach, std::move(details));
    sum.question = first.question;
    return sum;
}

RunResult NothingDone(const RunOrder& order, const RunFailure& failure) {
    ShareOrders shares;
    for (const ShareOrder& share : order.shares) {
        shares.push_back(&share);
    }
    RunResult result = {{}, failure};
    LeaveUndone(shares, failure, true, result.undone);
    return result;
}

}  // namespace programs
