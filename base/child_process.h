#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace base {

/// A program to run. The child gets these arguments and this environment and nothing else of the
/// host: default signal dispositions, no descriptor above 2, a session and process group of its
/// own, no terminal.
struct ChildSetup {
    std::string program;                   ///< path of the executable, see FindProgram()
    std::vector<std::string> arguments;    ///< argv, the program's own name included
    std::vector<std::string> environment;  ///< NAME=value
    std::string input;  ///< all of its standard input; at most kMaxChildInput bytes
    int folder = -1;    ///< descriptor of the folder that it runs in; -1: this process's own
    uint64_t max_file_bytes = 0;          ///< no file that it writes may grow longer; 0: no limit
    std::function<void(pid_t)> on_start;  ///< called once the program runs; may be empty
};

/// How many bytes a pipe takes without a reader.
constexpr size_t kMaxChildInput = 4096;

struct ChildResult {
    int start_error = 0;       ///< errno when the program could not be started, else 0
    bool cancelled = false;    ///< `cancelled` said true
    bool ended_early = false;  ///< EarlyEnd::reached said true
    int wait_status = 0;       ///< as waitpid() gives it; -1 when the child was reaped elsewhere
};

/// For a program whose work is done some time before it ends by itself.
struct EarlyEnd {
    int ready_fd = -1;  ///< once it is readable, `reached` is called often for a while
    std::function<bool(pid_t leader)> reached;  ///< true: the rest of the program is not needed
};

using OutputHandler = std::function<void(const char* bytes, size_t size)>;

/// Runs a program to its end and hands over what it writes, in pieces, some milliseconds after it
/// was written at the latest. An empty handler: the output is thrown away.
///
/// `cancelled` (may be empty) is asked once before the start, where true means that nothing is
/// started, and then several times a second. Once it says true the child's process group gets
/// SIGTERM, and SIGKILL soon after. However the run ends, an exception from a handler included,
/// nothing of the group is left; after an early end what is left has been killed, and is not waited
/// for. The child also ends when this process dies.
///
/// May be called from any thread. The process's signal dispositions are neither used nor changed; a
/// process that ignores SIGCHLD, or reaps every child it finds, gets wait_status -1.
ChildResult RunChild(const ChildSetup& setup, const std::function<bool()>& cancelled,
                     const OutputHandler& on_output, const OutputHandler& on_error,
                     const EarlyEnd& early_end = {});

/// The path of the executable `name`: itself when it holds a slash, else the first of that name
/// along `search_path` (folders joined by ":"). Empty when there is none.
std::string FindProgram(const std::string& name, const std::string& search_path);

/// The words as an argument vector for execv(), which does not change them. Valid as long as
/// `words` is.
std::vector<char*> ArgumentVector(const std::vector<std::string>& words);

/// Has this process end with SIGTERM when `parent`, which has forked it, ends. False when that has
/// ended already. For a child between fork() and execv().
bool EndWithParent(pid_t parent);

/// Every signal does what it does by default, and none is blocked. For a child between fork() and
/// execv().
void ResetSignals();

}  // namespace base
