#include "base/rsync_config.h"

#include <sstream>

#include "base/config_file.h"

namespace base {

RsyncConfig ReadRsyncConfig(const std::string& path) {
    constexpr uint64_t kMaxSeconds = 86400;
    const ConfigFile file(
        path, "rsync", {"port", "rsync", "ssh", "ssh_options", "answer_seconds", "dead_seconds"});
    const auto number = [&file](const char* key, int& value, uint64_t max) {
        value = static_cast<int>(file.Number(key, static_cast<uint64_t>(value), 1, max));
    };
    RsyncConfig config;
    number("port", config.daemon_port, kMaxPort);
    number("answer_seconds", config.answer_seconds, kMaxSeconds);
    number("dead_seconds", config.dead_seconds, kMaxSeconds);
    config.rsync = file.Text("rsync", config.rsync);
    config.ssh = file.Text("ssh", config.ssh);
    std::istringstream words(file.Text("ssh_options"));
    for (std::string word; words >> word;) {
        config.ssh_options.push_back(word);
    }
    return config;
}

}  // namespace base
