#include "ZEL/log.h"

#include <errno.h>
#include <fcntl.h>
#include <stdarg.h>
#include <syslog.h>
#include <time.h>
#include <unistd.h>

namespace ZEL {

namespace {

constexpr int kDefaultLevel = Logger::LEVEL_ERROR;
constexpr int kDefaultRotateCount = 50;
constexpr int32_t kRotateAbove = 0x100000;  // bytes; small enough to read, large enough for a day

// The places that the two messages about rotation name.
constexpr char kSource[] = "ZEL/log";
constexpr int kRenameLine = 145;
constexpr int kRemoveLine = 152;

// Opened for appending. A file that is made is nobody else's to read, whatever the umask: what it
// says is about other people's files.
FILE* OpenLog(const std::string& path) {
    const int fd =
        open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_LARGEFILE, 0640);
    FILE* const file = fd < 0 ? nullptr : fdopen(fd, "a");
    if (fd >= 0 && file == nullptr) {
        close(fd);
    }
    return file;
}

class MutexGuard {
public:
    explicit MutexGuard(pthread_mutex_t* mutex) : mutex_(mutex) { pthread_mutex_lock(mutex_); }
    ~MutexGuard() { pthread_mutex_unlock(mutex_); }
    MutexGuard(const MutexGuard&) = delete;
    MutexGuard& operator=(const MutexGuard&) = delete;

private:
    pthread_mutex_t* mutex_;
};

// Keeps errno: callers log between a failed call and their own use of errno.
class ErrnoKeeper {
public:
    ErrnoKeeper() : saved_(errno) {}
    ~ErrnoKeeper() { errno = saved_; }
    ErrnoKeeper(const ErrnoKeeper&) = delete;
    ErrnoKeeper& operator=(const ErrnoKeeper&) = delete;

private:
    int saved_;
};

// "path_number", cut at 1023 characters.
std::string RotatedName(const std::string& path, int number) {
    char name[1024];
    snprintf(name, sizeof name, "%s_%d", path.c_str(), number);
    return name;
}

// The local time in front of a line. Its text is kept for the other lines of the same second in the
// same zone; the log's lock guards it.
class TimePrefix {
public:
    // The number of bytes written, or EOF.
    int Write(FILE* stream) {
        const time_t now = time(nullptr);
        if (now != second_) {
            tzset();  // localtime_r() alone goes on with the zone that the process began with
        }
        struct tm local = {};
        const bool known = localtime_r(&now, &local) != nullptr;
        if (now != second_ || local.tm_gmtoff != offset_) {
            second_ = now;
            offset_ = local.tm_gmtoff;
            length_ = known ? strftime(text_, sizeof text_, "%b %d %H:%M:%S ", &local) : 0;
            text_[length_] = '\0';
        }
        return fputs(text_, stream) == EOF ? EOF : static_cast<int>(length_);
    }

private:
    time_t second_ = -1;  // that text_ tells
    long offset_ = 0;     // of its zone from UTC
    char text_[512] = "";
    size_t length_ = 0;  // of text_
};
TimePrefix time_prefix;

}  // namespace

Logger::Type Logger::log_type = Logger::SYSLOG;
std::atomic<int> Logger::log_level{kDefaultLevel};
FILE* Logger::log_fp = nullptr;
std::string Logger::log_path;
int32_t Logger::log_size = -1;
int Logger::rotate_cnt = kDefaultRotateCount;
pthread_mutex_t Logger::log_mutex = PTHREAD_MUTEX_INITIALIZER;

int Logger::Initialize(Type type, int level, const std::string& path, int rotate_count) {
    log_level = level;
    log_type = type;
    if (type == SYSLOG || type == STDOUT || type == STDERR) {
        log_fp = type == SYSLOG ? nullptr : type == STDOUT ? stdout : stderr;
        log_path.clear();
        log_size = -1;
        return 0;
    }
    if (path.empty()) {
        return -1;
    }
    FILE* file = OpenLog(path);
    if (file == nullptr) {
        return -1;
    }
    log_type = LOGFILE;
    log_fp = file;
    log_size = 0;
    log_path = path;
    rotate_cnt = rotate_count;
    return 0;
}

void Logger::LogMsg(Level level, const char* format, ...) {
    if (!Passes(level)) {
        return;
    }
    va_list arguments;
    va_start(arguments, format);
    LogLocked(level, format, arguments);
    va_end(arguments);
}

void Logger::LogPassed(Level level, const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    LogLocked(level, format, arguments);
    va_end(arguments);
}

void Logger::LogLocked(Level level, const char* format, va_list arguments) {
    const ErrnoKeeper keep;
    const MutexGuard lock(&log_mutex);
    if (Passes(level)) {
        Write(format, arguments);
    }
}

void Logger::Write(const char* format, va_list arguments) {
    if (log_type == SYSLOG) {
        vsyslog(LOG_ERR, format, arguments);
        return;
    }
    if (log_fp == nullptr) {
        return;  // never set up well, or silenced by a failed rotation
    }
    if (log_type != STDOUT && log_type != STDERR && log_type != LOGFILE) {
        vfprintf(stderr, format, arguments);
        return;
    }
    const int prefix = time_prefix.Write(log_fp);
    const int message = vfprintf(log_fp, format, arguments);
    fflush(log_fp);
    if (log_type != LOGFILE || log_size < 0 || prefix < 0 || message < 0) {
        return;
    }
    // 64 bits: one message may be up to INT_MAX bytes long.
    const int64_t size = int64_t{log_size} + prefix + message;
    if (size <= kRotateAbove) {
        log_size = static_cast<int32_t>(size);
        return;
    }
    Rotate();
    log_size = 0;
}

void Logger::Destroy() {
    if (log_type != LOGFILE) {
        return;
    }
    if (log_fp != nullptr) {
        fclose(log_fp);
    }
    // The type says standard error while the stream is standard output: lines go to standard
    // output.
    log_type = STDERR;
    log_level = kDefaultLevel;
    log_fp = stdout;
    log_size = -1;
    log_path.clear();
    rotate_cnt = kDefaultRotateCount;
}

int Logger::Rotate() {
    // 64 bits, so that no count given to Initialize can overflow here.
    for (int64_t i = int64_t{rotate_cnt} - 2; i >= 0; --i) {
        const std::string from = RotatedName(log_path, static_cast<int>(i));
        const std::string to = RotatedName(log_path, static_cast<int>(i + 1));
        if (rename(from.c_str(), to.c_str()) != 0) {
            syslog(LOG_ERR, "%s:%d failed to rename old_name '%s' to new_name '%s'.", kSource,
                   kRenameLine, from.c_str(), to.c_str());
        }
    }
    // The removal comes after the shift, so one file fewer survives than the count says.
    const std::string oldest = RotatedName(log_path, static_cast<int>(int64_t{rotate_cnt} - 1));
    if (remove(oldest.c_str()) != 0) {
        syslog(LOG_ERR, "%s:%d failed to remove old_name '%s'.", kSource, kRemoveLine,
               oldest.c_str());
    }
    if (log_fp != nullptr) {
        fclose(log_fp);
        log_fp = nullptr;
    }
    if (rename(log_path.c_str(), RotatedName(log_path, 0).c_str()) != 0) {
        return -1;
    }
    log_fp = OpenLog(log_path);
    return log_fp == nullptr ? -1 : 0;
}

}  // namespace ZEL
