#include "programs/zelctl/server/ask.h"

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <thread>

#include "programs/common/server_status.h"
#include "programs/common/task_fields.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/interrupt.h"

namespace zelctl {

namespace {

using programs::FailureKind;
using programs::RunFailure;
using std::chrono::steady_clock;

constexpr std::chrono::milliseconds kLookForInterrupt(100);

/// Sets a flag when the time is up, or when the user interrupts.
class Patience {
public:
    explicit Patience(std::chrono::seconds patience)
        : until_(steady_clock::now() + patience), thread_([this] { Run(); }) {}
    ~Patience() {
        {
            const std::lock_guard<std::mutex> lock(mutex_);
            over_ = true;
        }
        wake_.notify_one();
        thread_.join();
    }
    Patience(const Patience&) = delete;
    Patience& operator=(const Patience&) = delete;

    const std::atomic<bool>& Ended() const { return ended_; }

private:
    void Run() {
        std::unique_lock<std::mutex> lock(mutex_);
        while (!wake_.wait_for(lock, kLookForInterrupt, [this] { return over_; })) {
            if (Interrupted() || steady_clock::now() >= until_) {
                ended_ = true;
                return;
            }
        }
    }

    std::mutex mutex_;
    std::condition_variable wake_;
    bool over_ = false;
    std::atomic<bool> ended_{false};
    steady_clock::time_point until_;
    std::thread thread_;  // declared last, as it uses all other members
};

}  // namespace

std::optional<RunFailure> AskServer(const ZEL::SyncInfo& info,
                                    const std::vector<std::string>& shares,
                                    std::chrono::seconds patience) {
    const Patience waiting(patience);
    try {
        programs::TaskRun run(info, waiting.Ended());
        run.Connect();
        run.CheckPairing(shares);
        return {};
    } catch (const RunFailure& failure) {
        if (!waiting.Ended() || Interrupted()) {
            return failure;
        }
    }
    return RunFailure(FailureKind::kFailed, 0,
                      "server " + programs::ServerOf(info) + " gave no answer within " +
                          programs::Count(static_cast<uint64_t>(patience.count()), "second"));
}

bool IsSilence(const RunFailure& failure) {
    return failure.Kind() == FailureKind::kFailed && failure.Status() == 0;
}

bool IsRefusedForGood(const RunFailure& failure) {
    switch (failure.Status()) {
        case TARQ::Backup::STATUS_AUTHENTICATION:
        case programs::kUnknownCommand:
        case programs::kBadArgument:
        case programs::kOtherAccount:
        case programs::kConflicts:
        case programs::kNoEncryption:
        case programs::kNameTaken:
        case programs::kTooManyShares:
        case programs::kTooManyClients:
            return true;
        default:
            return false;
    }
}

}  // namespace zelctl
