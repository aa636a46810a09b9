#include "programs/zel_daemon/daemon_config.h"

#include "platform/internal/config.h"
#include "programs/common/text.h"
#include "tarq/root_path.h"

namespace zel_daemon {

namespace {

constexpr char kPath[] = "/usr/tarq/etc/zel_daemon.conf";

// Reads the numbers of the section; the first that does not pass is what `error` tells.
class NumberReader {
public:
    NumberReader(const tarq_internal::Section& section, std::string& error)
        : section_(section), error_(error) {}

    std::chrono::milliseconds Read(const char* key, std::chrono::milliseconds fallback,
                                   uint64_t min, uint64_t max) {
        return std::chrono::milliseconds(
            Read(key, static_cast<uint64_t>(fallback.count()), min, max));
    }

    uint64_t Read(const char* key, uint64_t fallback, uint64_t min, uint64_t max) {
        const std::string text = tarq_internal::ValueOf(section_, key);
        if (text.empty()) {
            return fallback;
        }
        const auto number = programs::ParseNumber(text, max);
        if (!number || *number < min) {
            if (error_.empty()) {
                error_ = TARQ::RootPath(kPath) + ": " + key + " is '" + programs::Printable(text) +
                         "', not a number from " + std::to_string(min) + " to " +
                         std::to_string(max);
            }
            return fallback;
        }
        return *number;
    }

private:
    const tarq_internal::Section& section_;
    std::string& error_;
};

}  // namespace

DaemonConfig ReadDaemonConfig(std::string& error) {
    error.clear();
    DaemonConfig config;
    tarq_internal::Section section;
    if (tarq_internal::ReadSection(TARQ::RootPath(kPath), "daemon", &section) ==
        tarq_internal::ReadResult::kFailed) {
        error = TARQ::RootPath(kPath) + " cannot be read or is no section file";
        return config;
    }
    NumberReader numbers(section, error);
    config.workers = static_cast<unsigned int>(numbers.Read("workers", config.workers, 1, 32));
    config.gather = numbers.Read("gather_ms", config.gather, 10, 600000);
    config.gather_max = numbers.Read("gather_max_ms", config.gather_max, 10, 600000);
    config.retry_first = numbers.Read("retry_first_ms", config.retry_first, 100, 86400000);
    config.retry_max = numbers.Read("retry_max_ms", config.retry_max, 100, 86400000);
    config.poll = std::chrono::seconds(
        numbers.Read("poll_seconds", static_cast<uint64_t>(config.poll.count()), 1, 86400));
    config.group = tarq_internal::ValueOf(section, "group");
    return error.empty() ? config : DaemonConfig();
}

}  // namespace zel_daemon
