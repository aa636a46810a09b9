#include "tests/support/syslog_capture.h"

#include <stdarg.h>
#include <stdio.h>

#include <mutex>

namespace {

std::mutex mutex;
std::vector<test::SyslogLine> lines;

void Record(int priority, const char* format, va_list arguments) {
    char text[8192];
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"  // it is the caller's
    vsnprintf(text, sizeof text, format, arguments);
#pragma GCC diagnostic pop
    const std::lock_guard<std::mutex> lock(mutex);
    lines.push_back({priority, text});
}

}  // namespace

// The C library's entry points, the checked ones of fortified builds included.
extern "C" {

__attribute__((visibility("default"))) void vsyslog(int priority, const char* format,
                                                    va_list arguments) {
    Record(priority, format, arguments);
}

__attribute__((visibility("default"))) void syslog(int priority, const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    Record(priority, format, arguments);
    va_end(arguments);
}

__attribute__((visibility("default"))) void __vsyslog_chk(int priority, int, const char* format,
                                                          va_list arguments) {
    Record(priority, format, arguments);
}

__attribute__((visibility("default"))) void __syslog_chk(int priority, int, const char* format,
                                                         ...) {
    va_list arguments;
    va_start(arguments, format);
    Record(priority, format, arguments);
    va_end(arguments);
}
}

namespace test {

std::vector<SyslogLine> TakeSyslog() {
    const std::lock_guard<std::mutex> lock(mutex);
    return std::move(lines);
}

std::vector<std::string> TakeSyslogTexts() {
    std::vector<std::string> texts;
    for (SyslogLine& line : TakeSyslog()) {
        texts.push_back(std::move(line.text));
    }
    return texts;
}

}  // namespace test
