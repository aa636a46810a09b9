#include "programs/zel_daemon/event_loop.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/timerfd.h>
#include <systemd/sd-event.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <deque>
#include <exception>
#include <list>
#include <mutex>
#include <system_error>
#include <utility>

#include "base/unique_fd.h"

namespace zel_daemon {

namespace {

using base::UniqueFd;

// How late a timer may be, so that the machine need not wake for each alone.
constexpr uint64_t kTimerSlackUs = 10000;

// The event library's results are negated error numbers.
int Require(int result, const char* what) {
    if (result < 0) {
        throw std::system_error(-result, std::generic_category(), what);
    }
    return result;
}

int RequireCall(int result, const char* what) {
    return Require(result < 0 ? -errno : result, what);
}

struct SourceFree {
    void operator()(sd_event_source* source) const { sd_event_source_disable_unref(source); }
};
struct EventFree {
    void operator()(sd_event* event) const { sd_event_unref(event); }
};
using SourceOwner = std::unique_ptr<sd_event_source, SourceFree>;

// A timer that never ends, but is cancelled when the clock is set.
void ArmClockWatch(int fd) {
    itimerspec never = {};
    never.it_value.tv_sec = LONG_MAX;
    RequireCall(timerfd_settime(fd, TFD_TIMER_ABSTIME | TFD_TIMER_CANCEL_ON_SET, &never, nullptr),
                "timerfd_settime");
}

}  // namespace

struct EventLoop::Impl {
    // What an event source calls, and the loop that it belongs to.
    struct Handler {
        Impl* loop;
        Task task;
        SourceOwner source;
    };

    // No exception may pass through the library's C frames.
    int Call(const Task& task) noexcept {
        try {
            task();
        } catch (...) {
            failure = std::current_exception();
            sd_event_exit(event.get(), 0);
        }
        return 0;
    }

    void Rethrow() {
        if (failure) {
            std::rethrow_exception(std::exchange(failure, nullptr));
        }
    }

    static int OnIo(sd_event_source*, int, uint32_t, void* data) {
        auto* handler = static_cast<Handler*>(data);
        return handler->loop->Call(handler->task);
    }
    static int OnSignalNumber(sd_event_source*, const signalfd_siginfo*, void* data) {
        auto* handler = static_cast<Handler*>(data);
        return handler->loop->Call(handler->task);
    }
    static int OnTime(sd_event_source*, uint64_t, void* data) {
        auto* loop = static_cast<Impl*>(data);
        const Task task = std::move(loop->timer_task);
        loop->timer_task = nullptr;
        return task ? loop->Call(task) : 0;
    }

    Handler& AddHandler(Task task) {
        handlers.push_back({this, std::move(task), nullptr});
        return handlers.back();
    }

    void AddIo(int fd, uint32_t events, Task task) {
        if (fd < 0) {
            return;
        }
        Handler& handler = AddHandler(std::move(task));
        sd_event_source* added = nullptr;
        Require(sd_event_add_io(event.get(), &added, fd, events, OnIo, &handler),
                "sd_event_add_io");
        handler.source.reset(added);
    }

    void RunPosted() {
        uint64_t count = 0;
        while (read(posted_fd.Get(), &count, sizeof count) < 0 && errno == EINTR) {
        }
        // What is posted meanwhile waits for the next round, so that nothing is starved.
        std::deque<Task> tasks;
        {
            const std::lock_guard<std::mutex> lock(mutex);
            tasks.swap(posted);
        }
        for (const Task& task : tasks) {
            task();
        }
    }

    std::unique_ptr<sd_event, EventFree> event;
    UniqueFd clock_fd;
    UniqueFd posted_fd;
    std::mutex mutex;
    std::deque<Task> posted;  // under the mutex
    Task timer_task;
    std::exception_ptr failure;
    std::list<Handler> handlers;
    SourceOwner timer;
};

EventLoop::EventLoop() : impl_(std::make_unique<Impl>()) {
    sd_event* event = nullptr;
    Require(sd_event_new(&event), "sd_event_new");
    impl_->event.reset(event);
    Require(sd_event_set_watchdog(event, 1), "sd_event_set_watchdog");
    impl_->posted_fd = UniqueFd(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    RequireCall(impl_->posted_fd.Get(), "eventfd");
    OnReadable(impl_->posted_fd.Get(), [impl = impl_.get()] { impl->RunPosted(); });
    // It needs a descriptor, of which there may be none when it is first set.
    sd_event_source* timer = nullptr;
    Require(sd_event_add_time(event, &timer, CLOCK_BOOTTIME, 0, kTimerSlackUs, Impl::OnTime,
                              impl_.get()),
            "sd_event_add_time");
    impl_->timer.reset(timer);
    Require(sd_event_source_set_enabled(timer, SD_EVENT_OFF), "sd_event_source_set_enabled");
}

EventLoop::~EventLoop() = default;

void EventLoop::OnReadable(int fd, Task task) {
    impl_->AddIo(fd, EPOLLIN, std::move(task));
}

void EventLoop::OnUrgent(int fd, Task task) {
    impl_->AddIo(fd, EPOLLPRI, std::move(task));
}

void EventLoop::OnSignal(int number, Task task) {
    sigset_t mask;
    sigemptyset(&mask);
    sigaddset(&mask, number);
    Require(-pthread_sigmask(SIG_BLOCK, &mask, nullptr), "pthread_sigmask");
    Impl::Handler& handler = impl_->AddHandler(std::move(task));
    sd_event_source* source = nullptr;
    Require(
        sd_event_add_signal(impl_->event.get(), &source, number, Impl::OnSignalNumber, &handler),
        "sd_event_add_signal");
    handler.source.reset(source);
}

void EventLoop::OnClockSet(Task task) {
    impl_->clock_fd = UniqueFd(timerfd_create(CLOCK_REALTIME, TFD_CLOEXEC | TFD_NONBLOCK));
    const int fd = impl_->clock_fd.Get();
    RequireCall(fd, "timerfd_create");
    ArmClockWatch(fd);
    OnReadable(fd, [fd, task = std::move(task)] {
        uint64_t count = 0;
        // ECANCELED is the news; the timer has to be armed again for the next.
        if (read(fd, &count, sizeof count) < 0 && errno == ECANCELED) {
            ArmClockWatch(fd);
            task();
        }
    });
}

void EventLoop::SetTimer(std::chrono::milliseconds delay, Task task) {
    impl_->timer_task = std::move(task);
    const auto microseconds = static_cast<uint64_t>(std::max<int64_t>(delay.count(), 0)) * 1000;
    Require(sd_event_source_set_time_relative(impl_->timer.get(), microseconds),
            "sd_event_source_set_time_relative");
    Require(sd_event_source_set_enabled(impl_->timer.get(), SD_EVENT_ONESHOT),
            "sd_event_source_set_enabled");
}

void EventLoop::ClearTimer() {
    impl_->timer_task = nullptr;
    sd_event_source_set_enabled(impl_->timer.get(), SD_EVENT_OFF);
}

void EventLoop::Post(Task task) {
    {
        const std::lock_guard<std::mutex> lock(impl_->mutex);
        impl_->posted.push_back(std::move(task));
    }
    const uint64_t one = 1;
    while (write(impl_->posted_fd.Get(), &one, sizeof one) < 0 && errno == EINTR) {
    }
}

void EventLoop::Run() {
    Require(sd_event_loop(impl_->event.get()), "sd_event_loop");
    impl_->Rethrow();
}

void EventLoop::Stop() {
    sd_event_exit(impl_->event.get(), 0);
}

bool EventLoop::RunOnce(std::chrono::milliseconds longest) {
    const auto microseconds = static_cast<uint64_t>(longest.count()) * 1000;
    const bool done = Require(sd_event_run(impl_->event.get(), microseconds), "sd_event_run") > 0;
    impl_->Rethrow();
    return done;
}

}  // namespace zel_daemon
