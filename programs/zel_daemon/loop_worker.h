// A thread that works for the loop's.
#pragma once

#include <exception>
#include <functional>
#include <memory>
#include <string>
#include <system_error>
#include <thread>
#include <utility>

#include "programs/zel_daemon/event_loop.h"
#include "programs/zel_daemon/shortage.h"

namespace zel_daemon {

/// Does one piece of work on a thread of its own, and has the loop's thread hear what comes of it:
/// after Start(), and never once this object is gone. Declared last in what owns it, which tells
/// the work to end before it goes.
///
/// Threads: the loop's, but for Tell().
class LoopWorker {
public:
    explicit LoopWorker(EventLoop& loop) : loop_(loop) {}
    ~LoopWorker() { Stop(); }
    LoopWorker(const LoopWorker&) = delete;
    LoopWorker& operator=(const LoopWorker&) = delete;

    /// The loop's thread calls `on_end`, which may end this object, with what `work` returns; when
    /// that throws, or there is no thread to be had, with what `failed` makes of the reason.
    template <typename Outcome>
    void Start(const std::function<Outcome()>& work,
               const std::function<Outcome(const std::string& why)>& failed,
               const std::function<void(const Outcome&)>& on_end) {
        const auto end = [this, on_end](const Outcome& outcome) {
            Tell([on_end, outcome] { on_end(outcome); });
        };
        try {
            thread_ = std::thread([work, failed, end] {
                try {
                    end(work());
                } catch (const std::exception& error) {
                    end(failed(error.what()));
                }
            });
        } catch (const std::system_error& error) {
            end(failed(ReasonOf(error.code().value())));
        }
    }

    /// Has the loop's thread call `step`. For the work, while it is under way.
    void Tell(std::function<void()> step) {
        loop_.Post([alive = alive_, step = std::move(step)] {
            if (*alive) {
                step();
            }
        });
    }

    /// Waits for the end of the work; nothing more is heard of it.
    void Stop() {
        *alive_ = false;
        if (thread_.joinable()) {
            thread_.join();
        }
    }

private:
    EventLoop& loop_;
    const std::shared_ptr<bool> alive_ = std::make_shared<bool>(true);  // the loop's thread alone
    std::thread thread_;
};

}  // namespace zel_daemon
