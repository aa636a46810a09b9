#include "base/child_process.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <optional>
#include <string_view>

#include "base/unique_fd.h"
#include "base/whole_file.h"

namespace base {

namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::microseconds;
using std::chrono::milliseconds;

// How often the caller is asked whether to go on.
constexpr milliseconds kAskInterval(100);
// The time between SIGTERM and SIGKILL, in which a program can clean up. rsync begins that when
// 400 ms have passed, and its receiver, a process of its own, ends last.
constexpr milliseconds kTermGrace(450);
constexpr milliseconds kHeirsGrace(100);
// How long to wait for the kernel to end a killed group: it needs far less.
constexpr milliseconds kBurialGrace(200);

// For how long and how often EarlyEnd::reached is asked.
constexpr milliseconds kEarlyEndWatch(100);
constexpr microseconds kEarlyEndStep(200);

// What a program writes line by line is not read line by line: it gathers for so long. A program
// that fills its pipe sooner is read without a pause.
constexpr milliseconds kGather(5);
constexpr size_t kPipeBytes = 65536;

constexpr int kFirstFreeFd = 3;

struct Pipe {
    UniqueFd read_end;
    UniqueFd write_end;
};

// Above the standard three, so that arranging those in the child overwrites no end of a pipe even
// when the host runs with a standard descriptor closed.
UniqueFd MoveAboveStandard(UniqueFd fd) {
    if (!fd || fd.Get() >= kFirstFreeFd) {
        return fd;
    }
    return UniqueFd(fcntl(fd.Get(), F_DUPFD_CLOEXEC, kFirstFreeFd));
}

bool MakePipe(Pipe* result) {
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0) {
        return false;
    }
    result->read_end = MoveAboveStandard(UniqueFd(ends[0]));
    result->write_end = MoveAboveStandard(UniqueFd(ends[1]));
    return result->read_end && result->write_end;
}

// The input goes into the pipe before there is a child: it fits, and while this process holds the
// read end no SIGPIPE can come of it.
UniqueFd MakeInput(const std::string& input) {
    if (input.empty()) {
        return MoveAboveStandard(UniqueFd(open("/dev/null", O_RDONLY | O_CLOEXEC)));
    }
    if (input.size() > kMaxChildInput) {
        errno = E2BIG;
        return UniqueFd();
    }
    Pipe pipe;
    if (!MakePipe(&pipe) || !WriteAll(pipe.write_end.Get(), input)) {
        return UniqueFd();
    }
    return std::move(pipe.read_end);
}

// Blocks every signal on this thread while it lives: a child must not run the host's handlers
// between fork() and the moment that its dispositions are the default ones.
class SignalsBlocked {
public:
    SignalsBlocked() {
        sigset_t all;
        sigfillset(&all);
        pthread_sigmask(SIG_SETMASK, &all, &before_);
    }
    ~SignalsBlocked() { pthread_sigmask(SIG_SETMASK, &before_, nullptr); }
    SignalsBlocked(const SignalsBlocked&) = delete;
    SignalsBlocked& operator=(const SignalsBlocked&) = delete;

private:
    sigset_t before_;
};

struct ChildPlan {
    const char* program;
    char* const* arguments;
    char* const* environment;
    int input, output, error, report;
    uint64_t max_file_bytes;
    int folder;
    pid_t parent;
};

// Between fork() and execve() only what is safe in the child of a process with threads.
[[noreturn]] void BecomeProgram(const ChildPlan& plan) {
    ResetSignals();
    setsid();
    bool ready = EndWithParent(plan.parent);
    if (plan.max_file_bytes != 0) {
        const rlimit limit = {static_cast<rlim_t>(plan.max_file_bytes),
                              static_cast<rlim_t>(plan.max_file_bytes)};
        ready = ready && setrlimit(RLIMIT_FSIZE, &limit) == 0;
    }
    ready = ready && (plan.folder < 0 || fchdir(plan.folder) == 0);
    ready = ready && dup2(plan.input, STDIN_FILENO) >= 0 && dup2(plan.output, STDOUT_FILENO) >= 0 &&
            dup2(plan.error, STDERR_FILENO) >= 0;
#ifdef SYS_close_range
    // Closes descriptors that the host left open without close-on-exec. On a kernel without the
    // call the program inherits them.
    constexpr unsigned int kCloseRangeCloexec = 4;
    syscall(SYS_close_range, kFirstFreeFd, ~0U, kCloseRangeCloexec);
#endif
    if (ready) {
        execve(plan.program, plan.arguments, plan.environment);
    }
    const int reason = errno;
    [[maybe_unused]] const ssize_t told = write(plan.report, &reason, sizeof reason);
    _exit(127);
}

int OpenPidFd(pid_t pid) {
#ifdef SYS_pidfd_open
    return static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
#else
    static_cast<void>(pid);
    return -1;
#endif
}

// Owns a child that leads its process group: kills what is left of the group and reaps the child.
class ProcessGroup {
public:
    explicit ProcessGroup(pid_t leader) : leader_(leader), exit_fd_(OpenPidFd(leader)) {}
    ~ProcessGroup() {
        if (!reaped_) {
            Kill();
            AwaitBurial(kBurialGrace);
        }
    }
    ProcessGroup(const ProcessGroup&) = delete;
    ProcessGroup& operator=(const ProcessGroup&) = delete;

    pid_t Leader() const { return leader_; }

    // Readable once the leader has ended; -1 on a kernel that has no such descriptor.
    int ExitFd() const { return exit_fd_.Get(); }

    void Signal(int number) { kill(-leader_, number); }

    // The leader stays a zombie, so its number still means this group.
    bool LeaderHasEnded() {
        siginfo_t info = {};
        const int result =
            waitid(P_PID, static_cast<id_t>(leader_), &info, WEXITED | WNOHANG | WNOWAIT);
        return result != 0 || info.si_pid == leader_;
    }

    // Kills what is left and reaps the leader. Its wait status.
    int Kill() {
        Signal(SIGKILL);
        return Reap();
    }

    // The same for a leader that has ended, whose children may clean up before.
    int KillLate() {
        const int status = Reap();
        // As long as one of them is left, nobody else gets the group's number.
        if (!AwaitBurial(kHeirsGrace)) {
            Signal(SIGKILL);
        }
        return status;
    }

    // The leader's children are reaped by init, in its own time.
    bool AwaitBurial(milliseconds longest) const {
        const Clock::time_point give_up = Clock::now() + longest;
        while (kill(-leader_, 0) == 0) {
            if (Clock::now() >= give_up) {
                return false;
            }
            usleep(1000);
        }
        return true;
    }

private:
    int Reap() {
        reaped_ = true;
        int status = 0;
        pid_t reaped;
        do {
            reaped = waitpid(leader_, &status, 0);
        } while (reaped < 0 && errno == EINTR);
        return reaped == leader_ ? status : -1;
    }

    pid_t leader_;
    UniqueFd exit_fd_;
    bool reaped_ = false;
};

// One stream of the child's.
struct Stream {
    UniqueFd fd;
    const OutputHandler* handler;

    // Reads what is there; closes the stream at its end. How much it was.
    size_t Read() {
        std::array<char, kPipeBytes> buffer;
        ssize_t count;
        do {
            count = read(fd.Get(), buffer.data(), buffer.size());
        } while (count < 0 && errno == EINTR);
        if (count > 0) {
            (*handler)(buffer.data(), static_cast<size_t>(count));
            return static_cast<size_t>(count);
        }
        if (count == 0 || errno != EAGAIN) {
            fd.Reset();
        }
        return 0;
    }
};

// Starts the child. 0, or errno.
int Start(const ChildSetup& setup, std::optional<ProcessGroup>* group, Stream* output,
          Stream* error) {
    const std::vector<char*> arguments = ArgumentVector(setup.arguments);
    const std::vector<char*> environment = ArgumentVector(setup.environment);
    Pipe out, err, report;
    const UniqueFd input = MakeInput(setup.input);
    if (!input || !MakePipe(&out) || !MakePipe(&err) || !MakePipe(&report)) {
        return errno;
    }
    for (const UniqueFd* end : {&out.read_end, &err.read_end}) {
        fcntl(end->Get(), F_SETFL, O_NONBLOCK);
    }
    const ChildPlan plan = {setup.program.c_str(),  arguments.data(),
                            environment.data(),     input.Get(),
                            out.write_end.Get(),    err.write_end.Get(),
                            report.write_end.Get(), setup.max_file_bytes,
                            setup.folder,           getpid()};
    pid_t pid;
    int fork_error;
    {
        const SignalsBlocked no_handlers;
        pid = fork();
        fork_error = errno;
        if (pid == 0) {
            BecomeProgram(plan);
        }
    }
    if (pid < 0) {
        return fork_error;
    }
    group->emplace(pid);
    // The report pipe is closed by the program's start; from then on the group exists.
    report.write_end.Reset();
    int reason = 0;
    ssize_t count;
    do {
        count = read(report.read_end.Get(), &reason, sizeof reason);
    } while (count < 0 && errno == EINTR);
    if (count == static_cast<ssize_t>(sizeof reason)) {
        return reason == 0 ? ECHILD : reason;
    }
    output->fd = std::move(out.read_end);
    error->fd = std::move(err.read_end);
    return 0;
}

// Follows an EarlyEnd: sleeps until its descriptor is readable, then asks for a while.
class EarlyEndWatch {
public:
    explicit EarlyEndWatch(const EarlyEnd& early_end)
        : early_end_(early_end), fd_(early_end.reached ? early_end.ready_fd : -1) {}

    // What to wait for; -1 when there is nothing.
    int Fd() const { return fd_; }
    bool IsAsking() const { return asking_; }

    void FdIsReadable() {
        fd_ = -1;
        asking_ = true;
        until_ = Clock::now() + kEarlyEndWatch;
    }

    bool IsReached(pid_t leader) {
        asking_ = asking_ && Clock::now() <= until_;
        return asking_ && early_end_.reached(leader);
    }

private:
    const EarlyEnd& early_end_;
    int fd_;
    bool asking_ = false;
    Clock::time_point until_;
};

// Waits until something happens or the time is up; without a time, for as long as it takes. While
// output gathers, that it comes is not what is waited for.
void Wait(const ProcessGroup& group, const Stream& output, const Stream& error, bool gathers,
          EarlyEndWatch* watch, std::optional<Clock::time_point> until) {
    // poll() skips descriptors of -1, which is what a closed stream and a kernel without pidfds
    // have.
    std::array<pollfd, 4> fds = {{{group.ExitFd(), POLLIN, 0},
                                  {gathers ? -1 : output.fd.Get(), POLLIN, 0},
                                  {gathers ? -1 : error.fd.Get(), POLLIN, 0},
                                  {watch->Fd(), POLLIN, 0}}};
    std::optional<microseconds> longest;
    if (watch->IsAsking()) {
        longest = kEarlyEndStep;
    } else if (until) {
        const auto left = std::chrono::ceil<microseconds>(*until - Clock::now());
        longest = std::clamp<microseconds>(left, microseconds(0), kAskInterval);
    } else if (group.ExitFd() < 0) {
        longest = kAskInterval;
    }
    if (gathers) {
        longest = std::min<microseconds>(longest.value_or(kGather), kGather);
    }
    timespec timeout = {};
    if (longest) {
        timeout.tv_nsec = static_cast<long>(longest->count() * 1000);  // less than a second
    }
    if (ppoll(fds.data(), fds.size(), longest ? &timeout : nullptr, nullptr) > 0 &&
        fds[3].revents != 0) {
        watch->FdIsReadable();
    }
}

}  // namespace

std::vector<char*> ArgumentVector(const std::vector<std::string>& words) {
    std::vector<char*> pointers;
    pointers.reserve(words.size() + 1);
    for (const std::string& word : words) {
        pointers.push_back(const_cast<char*>(word.c_str()));
    }
    pointers.push_back(nullptr);
    return pointers;
}

bool EndWithParent(pid_t parent) {
    // The second look is for a parent that died before the first call took effect.
    return prctl(PR_SET_PDEATHSIG, SIGTERM) == 0 && getppid() == parent;
}

void ResetSignals() {
    struct sigaction default_action = {};
    default_action.sa_handler = SIG_DFL;
    for (int number = 1; number < NSIG; ++number) {
        sigaction(number, &default_action, nullptr);
    }
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
}

ChildResult RunChild(const ChildSetup& setup, const std::function<bool()>& cancelled,
                     const OutputHandler& on_output, const OutputHandler& on_error,
                     const EarlyEnd& early_end) {
    const OutputHandler nowhere = [](const char*, size_t) {};
    Stream output = {UniqueFd(), on_output ? &on_output : &nowhere};
    Stream error = {UniqueFd(), on_error ? &on_error : &nowhere};
    std::optional<ProcessGroup> group;
    ChildResult result;
    if (cancelled && cancelled()) {
        result.cancelled = true;
        return result;
    }
    result.start_error = Start(setup, &group, &output, &error);
    if (result.start_error != 0) {
        return result;
    }
    if (setup.on_start) {
        setup.on_start(group->Leader());
    }

    std::optional<Clock::time_point> next_step;  // the next question, or the end of the grace
    if (cancelled) {
        next_step = Clock::now() + kAskInterval;
    }
    EarlyEndWatch watch(early_end);
    bool gathers = false;
    bool was_killed = false;
    while (!group->LeaderHasEnded()) {
        Wait(*group, output, error, gathers, &watch, next_step);
        size_t most = 0;
        for (Stream* stream : {&output, &error}) {
            if (stream->fd) {
                most = std::max(most, stream->Read());
            }
        }
        gathers = most > 0 && most < kPipeBytes;
        if (!result.cancelled && watch.IsReached(group->Leader())) {
            result.ended_early = true;
            break;
        }
        if (!next_step || Clock::now() < *next_step) {
            continue;
        }
        if (result.cancelled) {
            group->Signal(SIGKILL);
            was_killed = true;
            next_step = Clock::now() + kTermGrace;
        } else if (cancelled()) {
            result.cancelled = true;
            group->Signal(SIGTERM);
            next_step = Clock::now() + kTermGrace;
        } else {
            next_step = Clock::now() + kAskInterval;
        }
    }
    const bool may_clean_up = result.cancelled && !was_killed;
    result.wait_status = may_clean_up ? group->KillLate() : group->Kill();
    if (!result.ended_early) {
        group->AwaitBurial(kBurialGrace);
    }
    // The whole group has ended: what is left to read is already in the pipes.
    for (Stream* stream : {&output, &error}) {
        while (stream->fd && stream->Read() > 0) {
        }
    }
    return result;
}

std::string FindProgram(const std::string& name, const std::string& search_path) {
    if (name.find('/') != std::string::npos) {
        return name;
    }
    std::string_view rest = search_path;
    while (!name.empty() && !rest.empty()) {
        const size_t end = std::min(rest.find(':'), rest.size());
        std::string candidate(rest.substr(0, end));
        rest.remove_prefix(std::min(end + 1, rest.size()));
        candidate += "/" + name;
        if (access(candidate.c_str(), X_OK) == 0) {
            return candidate;
        }
    }
    return "";
}

}  // namespace base
