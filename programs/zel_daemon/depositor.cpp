#include "programs/zel_daemon/depositor.h"

#include <algorithm>
#include <chrono>
#include <ctime>
#include <system_error>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "programs/common/configuration.h"
#include "programs/common/deposits.h"
#include "programs/common/host.h"
#include "programs/common/run_result.h"
#include "programs/common/server_status.h"
#include "programs/common/task_fields.h"
#include "programs/common/text.h"

namespace zel_daemon {

namespace {

using ZEL::Logger;

constexpr int64_t kQuiet = 3000;  // milliseconds
constexpr RetryDelays kDelays = {60000, 3600000};
constexpr int64_t kSoonest = 60000;  // between two tries, whatever has changed
// A server of an earlier version may have been upgraded by then.
constexpr int64_t kUntilUpgrade = 86400000;
// A server that was set up anew has nothing of it.
constexpr int64_t kSureForSeconds = int64_t{7} * 86400;
constexpr int64_t kRecoveryLook = 60000;

int64_t Now() {
    return std::chrono::duration_cast<std::chrono::milliseconds>(
               std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

// Tells one configuration of a machine from its next: nobody gains by making two alike.
std::string DigestOf(const std::string& text) {
    uint64_t hash = 0xcbf29ce484222325;  // FNV-1a
    for (const char byte : text) {
        hash = (hash ^ static_cast<unsigned char>(byte)) * 0x100000001b3;
    }
    return std::to_string(hash) + "-" + std::to_string(text.size());
}

void Log(Logger::Level level, const std::string& text) {
    const char* const word = level == Logger::LEVEL_WARNING ? "WARNING"
                             : level == Logger::LEVEL_NOTE  ? "NOTE"
                                                            : "INFO";
    Logger::LogMsg(level, "[%s] zel_daemon(%d): %s\n", word, __LINE__, text.c_str());
}

// A store that cannot be read, or written to, ends no daemon for this.
void DoOnLoop(const std::function<void()>& work) {
    try {
        work();
    } catch (const std::exception& error) {
        Log(Logger::LEVEL_WARNING, error.what());
    }
}

}  // namespace

Depositor::Depositor(EventLoop& loop, std::function<DepositOrder()> collect,
                     std::function<void(const DepositNote&)> note)
    : loop_(loop), collect_(std::move(collect)), note_(std::move(note)) {
    try {
        thread_ = std::thread([this] { Work(); });
    } catch (const std::system_error& error) {
        Log(Logger::LEVEL_WARNING,
            std::string("no thread is left to leave this machine's configuration with its "
                        "servers: ") +
                error.what());
    }
}

Depositor::~Depositor() {
    {
        const std::lock_guard<std::mutex> lock(mutex_);
        end_ = true;
    }
    wake_.notify_all();
    if (thread_.joinable()) {
        thread_.join();
    }
}

void Depositor::Changed() {
    {
        const std::lock_guard<std::mutex> lock(mutex_);
        quiet_at_ = Now() + kQuiet;
    }
    wake_.notify_all();
}

void Depositor::Work() {
    while (true) {
        {
            std::unique_lock<std::mutex> lock(mutex_);
            if (!WaitForWork(lock)) {
                return;
            }
        }
        try {
            if (const std::optional<DepositOrder> order = Collect()) {
                Deposit(*order);
            }
        } catch (const std::exception& error) {
            // A catalogue that cannot be read, say: its change is the next reason to look.
            Log(Logger::LEVEL_WARNING,
                std::string("this machine's configuration is left nowhere: ") + error.what());
        }
    }
}

// Until there has been a change and quiet after it, or something is to be tried again. False at the
// end.
bool Depositor::WaitForWork(std::unique_lock<std::mutex>& lock) {
    while (!end_) {
        const int64_t now = Now();
        const int64_t at = std::min(NextTry(), quiet_at_.value_or(INT64_MAX));
        if (at <= now) {
            if (quiet_at_ && *quiet_at_ <= now) {
                quiet_at_.reset();
                for (auto& [account, failure] : failures_) {
                    failure.Hasten(now, kSoonest);
                }
            }
            return true;
        }
        if (at < INT64_MAX) {
            wake_.wait_for(lock, std::chrono::milliseconds(at - now));
        } else {
            wake_.wait(lock);
        }
    }
    return false;
}

std::optional<DepositOrder> Depositor::Collect() {
    loop_.Post([this] {
        DepositOrder order;
        DoOnLoop([&] { order = collect_(); });
        const std::lock_guard<std::mutex> lock(mutex_);
        order_ = std::move(order);
        wake_.notify_all();
    });
    std::unique_lock<std::mutex> lock(mutex_);
    wake_.wait(lock, [this] { return end_ || order_; });
    std::optional<DepositOrder> order;
    order.swap(order_);
    return order;
}

void Depositor::Deposit(const DepositOrder& order) {
    std::map<Account, Backoff> failures;  // of those that there still are
    failures.swap(failures_);
    look_again_ = INT64_MAX;
    if (order.tasks.empty()) {
        return;
    }
    if (order.waits) {
        look_again_ = Now() + kRecoveryLook;
        return;
    }
    look_again_ = Now() + kSureForSeconds * 1000;
    const std::string text =
        programs::WriteConfiguration(order.tasks, programs::ListedShares(), false);
    if (text.size() > programs::kMaxDepositBytes) {
        throw programs::Failure("it has " + std::to_string(text.size()) + " bytes, more than " +
                                std::to_string(programs::kMaxDepositBytes));
    }
    // Another identity is another client.
    const std::string digest = DigestOf(ZEL::GetClientID() + "\n" + text);
    for (const ZEL::SyncInfo& account : order.accounts) {
        const DepositNote note = {programs::ServerOf(account), account.GetUser(), digest,
                                  time(nullptr)};
        const bool taken =
            std::any_of(order.taken.begin(), order.taken.end(), [&](const DepositNote& before) {
                return before.server == note.server && before.user == note.user &&
                       before.digest == digest && before.time <= note.time &&
                       note.time - before.time < kSureForSeconds;
            });
        if (!taken) {
            Backoff& failure = failures_[{note.server, note.user}] =
                failures[{note.server, note.user}];
            if (!failure.Waiting() || failure.Due(Now())) {
                Try(account, text, note);
            }
        }
    }
}

void Depositor::Try(const ZEL::SyncInfo& account, const std::string& text,
                    const DepositNote& note) {
    const Account key = {note.server, note.user};
    const std::string unprepared = programs::PrepareHost();
    try {
        if (!unprepared.empty()) {
            throw programs::RunFailure(programs::FailureKind::kLocal, 0, unprepared);
        }
        programs::DepositSession session(account, end_);
        session.Connect();
        session.Leave(text);
        failures_.erase(key);
        loop_.Post([this, note] { DoOnLoop([&] { note_(note); }); });
    } catch (const programs::RunFailure& failure) {
        if (end_) {
            return;
        }
        const bool old = failure.Status() == programs::kUnknownCommand;
        Backoff& waits = failures_[key];
        waits.Failed(Now(), old ? RetryDelays{kUntilUpgrade, kUntilUpgrade} : kDelays, 0.5);
        // Once, as long as it goes on.
        Log(waits.Failures() > 1 || old ? Logger::LEVEL_INFO : Logger::LEVEL_NOTE,
            "the configuration is not left with server " + note.server +
                ", and will be tried again: " + failure.what());
    }
}

int64_t Depositor::NextTry() const {
    int64_t first = look_again_;
    for (const auto& [account, failure] : failures_) {
        first = std::min(first, failure.At().value_or(INT64_MAX));
    }
    return first;
}

}  // namespace zel_daemon
