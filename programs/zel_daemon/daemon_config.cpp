#include "programs/zel_daemon/daemon_config.h"

#include <grp.h>

#include <cerrno>
#include <cstring>
#include <set>

#include "platform/internal/config.h"
#include "platform/internal/section_check.h"
#include "programs/common/text.h"
#include "tarq/root_path.h"

namespace zel_daemon {

namespace {

constexpr char kPath[] = "/usr/tarq/etc/zel_daemon.conf";
constexpr char kSection[] = "daemon";

// Reads values of the section, which it knows to be no others than `keys`.
class SectionReader {
public:
    SectionReader(const std::string& path, const std::set<std::string>& keys) : path_(path) {
        if (tarq_internal::ReadSection(path, kSection, &section_) ==
            tarq_internal::ReadResult::kFailed) {
            throw ConfigError(path + " cannot be read: " + strerror(errno));
        }
        const std::string stray = tarq_internal::FindStray(
            tarq_internal::ReadTextFile(path).value_or(""), kSection, keys);
        if (!stray.empty()) {
            throw ConfigError(path + ", " + stray);
        }
    }

    std::chrono::milliseconds Read(const char* key, std::chrono::milliseconds fallback,
                                   uint64_t min, uint64_t max) const {
        return std::chrono::milliseconds(
            Read(key, static_cast<uint64_t>(fallback.count()), min, max));
    }

    uint64_t Read(const char* key, uint64_t fallback, uint64_t min, uint64_t max) const {
        const std::string text = Text(key);
        if (text.empty()) {
            return fallback;
        }
        const auto number = programs::ParseNumber(text, max);
        if (!number || *number < min) {
            throw ConfigError(path_ + ": " + key + " is '" + programs::Printable(text) +
                              "', not a number from " + std::to_string(min) + " to " +
                              std::to_string(max));
        }
        return *number;
    }

    std::string Text(const char* key) const { return tarq_internal::ValueOf(section_, key); }

private:
    const std::string path_;
    tarq_internal::Section section_;
};

}  // namespace

DaemonConfig ReadDaemonConfig() {
    const std::string path = TARQ::RootPath(kPath);
    const SectionReader file(path, {"workers", "gather_ms", "gather_max_ms", "retry_first_ms",
                                    "retry_max_ms", "poll_seconds", "group"});
    DaemonConfig config;
    config.workers = static_cast<unsigned int>(file.Read("workers", config.workers, 1, 32));
    config.gather = file.Read("gather_ms", config.gather, 10, 600000);
    config.gather_max = file.Read("gather_max_ms", config.gather_max, 10, 600000);
    config.retry_first = file.Read("retry_first_ms", config.retry_first, 100, 86400000);
    config.retry_max = file.Read("retry_max_ms", config.retry_max, 100, 86400000);
    config.poll = std::chrono::seconds(
        file.Read("poll_seconds", static_cast<uint64_t>(config.poll.count()), 1, 86400));
    config.group = file.Text("group");
    if (!config.group.empty() && getgrnam(config.group.c_str()) == nullptr) {
        throw ConfigError(path + ": group is '" + programs::Printable(config.group) +
                          "', which this machine has not");
    }
    return config;
}

}  // namespace zel_daemon
