// The process-wide log.
//
// A program calls Logger::Initialize once to choose where lines go; every module then calls
// Logger::LogMsg. Until then lines at error level go to the system log.
#pragma once

#include <pthread.h>
#include <stdarg.h>
#include <stdio.h>

#include <atomic>
#include <cstdint>
#include <string>

namespace ZEL {

#pragma GCC visibility push(default)

/// Static operations only; there is one log in a process.
///
/// Threads: LogMsg may be called from any thread at any time. Initialize and Destroy must not run
/// while another thread logs.
class Logger {
public:
    /// Where lines go.
    enum Type : int32_t {
        SYSLOG = 0,  ///< the system log
        STDOUT = 1,  ///< standard output
        STDERR = 2,  ///< standard error
        LOGFILE = 3  ///< a file given by path, rotated when it passes 1 MiB
    };

    /// How grave a line is, in the system log's numbering. The matching tag is part of each
    /// message's own text.
    enum Level : int32_t {
        LEVEL_ERROR = 3,    ///< "[ERROR]"
        LEVEL_WARNING = 4,  ///< "[WARNING]"
        LEVEL_NOTE = 5,     ///< "[NOTE]"
        LEVEL_INFO = 6,     ///< "[INFO]"
        LEVEL_DEBUG = 7     ///< "[DEBUG]"
    };

    Logger() = delete;

    /// Chooses the destination and the highest level that is still written.
    ///
    /// `path` and `rotate_cnt` count only for a file: lines are appended to `path`, and after a
    /// rotation `path`_0 (the newest) to `path`_(rotate_cnt - 2) hold the older lines. What the
    /// file already holds does not count towards its size. A file that is made has mode 0640 at
    /// most. Any type but 0, 1 and 2 means a file.
    ///
    /// Returns 0, or -1 when the path is empty or the file cannot be opened; type and level are set
    /// all the same, and the stream of an earlier call stays in use. May be called again to switch;
    /// a file that an earlier call opened is not closed then.
    static int Initialize(Type type, int level, const std::string& path, int rotate_cnt);

    /// Writes one message, formatted as printf does it, when `level` is not above the chosen one.
    /// Adds the local time in front (not in the system log) and no newline. The system log gets
    /// every message at priority error. Never fails; errno is kept.
    static void LogMsg(Level level, const char* format, ...) __attribute__((format(printf, 2, 3)));

    /// Whether a message of that level would be written. It may change before the message comes.
    static bool Passes(Level level) { return level <= log_level.load(std::memory_order_relaxed); }

    /// Closes the file of a file set-up; lines at error level then go to standard output. Does
    /// nothing for the other destinations.
    static void Destroy();

    /// Shifts the rotated files by one and starts a new file. Returns 0, or -1 when the new file
    /// cannot be made: the log is silent from then on. LogMsg calls it with its lock held; it takes
    /// none itself.
    static int Rotate();

private:
    // LogMsg() of a message that has passed a first look at the level.
    static void LogPassed(Level level, const char* format, ...)
        __attribute__((format(printf, 2, 3)));
    // Takes the lock, under which the look at the level decides.
    static void LogLocked(Level level, const char* format, va_list arguments)
        __attribute__((format(printf, 2, 0)));
    // Writes one message; log_mutex is held.
    static void Write(const char* format, va_list arguments) __attribute__((format(printf, 1, 0)));

    static Type log_type;               // current destination
    static std::atomic<int> log_level;  // highest level that is written
    static FILE* log_fp;                // open stream of types 1 to 3
    static std::string log_path;        // the file of type 3
    static int32_t log_size;            // bytes written to the current file; -1: not counted
    static int rotate_cnt;              // one more than the number of rotated files kept
    static pthread_mutex_t log_mutex;   // taken around every write and every rotation
};

#if defined(__GNUC__) && !defined(__clang__)
// Most calls are filtered: here that costs a compare at the call, before any argument is passed.
// The function itself is still in the library. The format is checked at the call.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
inline __attribute__((gnu_inline, always_inline)) void Logger::LogMsg(Level level,
                                                                      const char* format, ...) {
    if (Passes(level)) {
        LogPassed(level, format, __builtin_va_arg_pack());
    }
}
#pragma GCC diagnostic pop
#endif

#pragma GCC visibility pop

}  // namespace ZEL
