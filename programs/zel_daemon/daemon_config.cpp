#include "programs/zel_daemon/daemon_config.h"

#include <grp.h>

#include <type_traits>

#include "tarq/root_path.h"

namespace zel_daemon {

namespace {

constexpr char kPath[] = "/usr/tarq/etc/zel_daemon.conf";

}  // namespace

DaemonConfig ReadDaemonConfig() {
    const base::ConfigFile file(
        TARQ::RootPath(kPath), "daemon",
        {"workers", "gather_ms", "gather_max_ms", "retry_first_ms", "retry_max_ms", "poll_seconds",
         "verify_rate", "verify_files", "verify_gap_ms", "group"});
    const auto time = [&file](const char* key, auto& value, uint64_t min, uint64_t max) {
        value = std::decay_t<decltype(value)>(
            file.Number(key, static_cast<uint64_t>(value.count()), min, max));
    };
    DaemonConfig config;
    config.workers = static_cast<unsigned int>(file.Number("workers", config.workers, 1, 32));
    time("gather_ms", config.debounce, 10, 600000);
    time("gather_max_ms", config.debounce_max, 10, 600000);
    time("retry_first_ms", config.retry_first, 100, 86400000);
    time("retry_max_ms", config.retry_max, 100, 86400000);
    time("poll_seconds", config.poll, 1, 86400);
    config.verify_rate =
        static_cast<unsigned int>(file.Number("verify_rate", config.verify_rate, 1, 100000));
    config.verify_files =
        static_cast<unsigned int>(file.Number("verify_files", config.verify_files, 1, 1000000));
    time("verify_gap_ms", config.verify_gap, 10, 3600000);
    config.group = file.Text("group");
    if (!config.group.empty() && getgrnam(config.group.c_str()) == nullptr) {
        throw file.Wrong("group", "which this machine has not");
    }
    return config;
}

}  // namespace zel_daemon
