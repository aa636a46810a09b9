#pragma once

#include <string>
#include <vector>

namespace test {

struct SyslogLine {
    int priority;
    std::string text;
};

/// What the process has sent to the system log since the last call. Only in programs linked with
/// test_syslog, whose system log goes nowhere else.
std::vector<SyslogLine> TakeSyslog();

/// The same, texts only.
std::vector<std::string> TakeSyslogTexts();

}  // namespace test
