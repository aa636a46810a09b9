#include "tests/support/log_capture.h"

#include <regex>
#include <sstream>

#include "ZEL/log.h"

namespace test {

LogCapture::LogCapture(int level) {
    // The count keeps rotation away from the text: no test logs 50 MiB.
    ZEL::Logger::Initialize(ZEL::Logger::LOGFILE, level, folder_.Path("log"), 50);
}

LogCapture::~LogCapture() {
    ZEL::Logger::Destroy();
    ZEL::Logger::Initialize(ZEL::Logger::SYSLOG, ZEL::Logger::LEVEL_ERROR, "", 0);
}

std::string LogCapture::Text() const {
    static const std::regex time_prefix("[A-Z][a-z]{2} [0-9]{2} [0-9:]{8} (\\[[A-Z]+\\] )");
    static const std::regex line_number("(\\[[A-Z]+\\] ZEL/[a-z_]+)\\([0-9]+\\)");
    const std::string raw = ReadFile(folder_.Path("log"));
    return std::regex_replace(std::regex_replace(raw, time_prefix, "$1"), line_number, "$1(N)");
}

std::vector<std::string> LogCapture::Lines() const {
    std::vector<std::string> lines;
    std::istringstream text(Text());
    for (std::string line; std::getline(text, line);) {
        lines.push_back(line);
    }
    return lines;
}

}  // namespace test
