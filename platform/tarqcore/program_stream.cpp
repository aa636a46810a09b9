#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <stdarg.h>
#include <string.h>
#include <sys/wait.h>
#include <tarq/root_path.h>
#include <unistd.h>

#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "base/unique_fd.h"
#include "platform/internal/error.h"

using base::UniqueFd;
using tarq_internal::Fail;
using tarq_internal::Guarded;

namespace {

/// Which program stands behind which stream, so that each close waits for its own.
struct Programs {
    std::mutex mutex;
    std::map<FILE*, pid_t> by_stream;
};

Programs& Running() {
    static Programs& programs =
        *new Programs;  // outlives every thread that may still close a stream at exit
    return programs;
}

/// Owner of posix_spawn's attributes and file actions.
struct SpawnSetup {
    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attributes;

    SpawnSetup() {
        posix_spawn_file_actions_init(&actions);
        posix_spawnattr_init(&attributes);
    }
    SpawnSetup(const SpawnSetup&) = delete;
    SpawnSetup& operator=(const SpawnSetup&) = delete;
    ~SpawnSetup() {
        posix_spawnattr_destroy(&attributes);
        posix_spawn_file_actions_destroy(&actions);
    }

    /// The child gets `end` as its descriptor `as`, no descriptor above the standard three, and the
    /// signal handling that a program expects to start with, whatever this process blocks or
    /// ignores.
    bool Prepare(int end, int as) {
        sigset_t nothing;
        sigset_t pipe_signal;
        sigemptyset(&nothing);
        sigemptyset(&pipe_signal);
        sigaddset(&pipe_signal, SIGPIPE);
        const int error =
            posix_spawn_file_actions_adddup2(&actions, end, as) |
            posix_spawn_file_actions_addclosefrom_np(&actions, STDERR_FILENO + 1) |
            posix_spawnattr_setsigmask(&attributes, &nothing) |
            posix_spawnattr_setsigdefault(&attributes, &pipe_signal) |
            posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
        return error == 0;
    }
};

FILE* FailStart(int error) {
    errno = error;
    Fail(TARQ_ERR_OPEN_FILE);
    return nullptr;
}

// Where the maker's systems and others have the same programs, and what stands in for a missing
// one.
constexpr char kMakersFolder[] = "/usr/local/bin/";
constexpr char kHostFolder[] = "/usr/bin/";
constexpr char kNoProgram[] = "/bin/false";

/// Whether the calling process has asked for this program in vain before.
bool IsKnownToBeMissing(const std::string& program) {
    static std::mutex mutex;
    static std::set<std::string>& missing = *new std::set<std::string>;  // outlives every thread
    const std::lock_guard<std::mutex> lock(mutex);
    return !missing.insert(program).second;
}

/// The program to run for `program`: itself, but for one of the maker's that is not there.
std::string ProgramFor(const std::string& program) {
    const std::string folder = TARQ::RootPath(kMakersFolder);
    if (program.compare(0, folder.size(), folder) != 0 || access(program.c_str(), F_OK) == 0) {
        return program;
    }
    std::string other = TARQ::RootPath(kHostFolder) + program.substr(folder.size());
    if (access(other.c_str(), F_OK) == 0) {
        return other;
    }
    return IsKnownToBeMissing(program) ? kNoProgram : program;
}

struct CloseStream {
    void operator()(FILE* stream) const { fclose(stream); }
};

FILE* Start(const char* program, bool reads, const std::vector<char*>& arguments) {
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0) {
        return FailStart(errno);
    }
    const int own_end = ends[reads ? 0 : 1];
    const UniqueFd program_end(ends[reads ? 1 : 0]);
    std::unique_ptr<FILE, CloseStream> stream(fdopen(own_end, reads ? "r" : "w"));
    if (stream == nullptr) {
        const int error = errno;
        close(own_end);
        return FailStart(error);
    }
    SpawnSetup setup;
    if (!setup.Prepare(program_end.Get(), reads ? STDOUT_FILENO : STDIN_FILENO)) {
        return FailStart(ENOMEM);
    }

    Programs& running = Running();
    const std::lock_guard<std::mutex> lock(running.mutex);
    // The place in the table comes first: once the program runs, nothing may fail any more.
    const auto entry = running.by_stream.emplace(stream.get(), 0).first;
    const int error = posix_spawn(&entry->second, program, &setup.actions, &setup.attributes,
                                  arguments.data(), environ);
    if (error != 0) {
        running.by_stream.erase(entry);
        return FailStart(error);
    }
    return stream.release();
}

}  // namespace

FILE* KAPICPopen(const char* program, const char* mode, ...) {
    const bool reads = mode != nullptr && strcmp(mode, "r") == 0;
    if (program == nullptr || mode == nullptr || (!reads && strcmp(mode, "w") != 0)) {
        errno = EINVAL;
        Fail(TARQ_ERR_BAD_PARAMETER);
        return nullptr;
    }
    va_list given;
    va_start(given, mode);
    FILE* stream = Guarded<FILE*>(nullptr, [&] {
        std::vector<char*> arguments{
            const_cast<char*>(program)};  // posix_spawn changes none of them
        do {
            arguments.push_back(va_arg(given, char*));
        } while (arguments.back() != nullptr);
        return Start(ProgramFor(program).c_str(), reads, arguments);
    });
    va_end(given);
    return stream;
}

int KAPICPclose(FILE* stream) {
    pid_t pid = 0;
    {
        Programs& running = Running();
        const std::lock_guard<std::mutex> lock(running.mutex);
        const auto entry = running.by_stream.find(stream);
        if (entry == running.by_stream.end()) {
            errno = EINVAL;
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        pid = entry->second;
        running.by_stream.erase(entry);
    }
    fclose(stream);
    int status = 0;
    while (waitpid(pid, &status, 0) < 0) {
        if (errno != EINTR) {
            return Fail(TARQ_ERR_READ_FILE);
        }
    }
    return status;
}
