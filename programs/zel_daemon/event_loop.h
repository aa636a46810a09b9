// The one loop of the daemon: descriptors, timers, signals, and work that other threads hand over.
#pragma once

#include <chrono>
#include <functional>
#include <memory>

namespace zel_daemon {

/// Stands on the system manager's event library, which also answers its watchdog.
///
/// Threads: everything but Post() belongs to the thread that made it, which is the one that runs
/// it. Constructor and set-up throw std::system_error.
class EventLoop {
public:
    using Task = std::function<void()>;

    EventLoop();
    virtual ~EventLoop();
    EventLoop(const EventLoop&) = delete;
    EventLoop& operator=(const EventLoop&) = delete;

    /// Calls `task` whenever `fd` can be read, for the life of the loop; never for -1.
    void OnReadable(int fd, Task task);
    /// The same, whenever it has urgent data (POLLPRI).
    void OnUrgent(int fd, Task task);
    /// Calls `task` for each of these signals, which the process no longer takes otherwise. Before
    /// any thread is started.
    void OnSignal(int number, Task task);
    /// Calls `task` when somebody sets the clock.
    void OnClockSet(Task task);

    /// Calls `task` once, after so long; time asleep counts. One timer: setting it again moves it.
    /// Tests, whose clocks they move themselves, have timers of their own.
    virtual void SetTimer(std::chrono::milliseconds delay, Task task);
    virtual void ClearTimer();

    /// Has `task` called by the loop's thread soon. Any thread may call.
    void Post(Task task);

    /// Runs until Stop(). An exception from a task ends it and comes out here.
    void Run();
    void Stop();
    /// Does what there is to do by then, once. False when there was nothing.
    bool RunOnce(std::chrono::milliseconds longest);

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace zel_daemon
