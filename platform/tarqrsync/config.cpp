#include "platform/tarqrsync/config.h"

#include <charconv>
#include <sstream>

#include "platform/internal/config.h"
#include "platform/internal/section_check.h"
#include "tarq/root_path.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr char kConfigPath[] = "/usr/tarq/etc/tarqrsync.conf";
constexpr char kSection[] = "rsync";

bool ParsePort(const std::string& text, int* port) {
    const char* end = text.data() + text.size();
    const auto [rest, error] = std::from_chars(text.data(), end, *port);
    return error == std::errc() && rest == end && *port >= 1 && *port <= kMaxPort;
}

}  // namespace

std::string ReadConfig(Config* config) {
    const std::string path = RootPath(kConfigPath);
    tarq_internal::Section values;
    if (tarq_internal::ReadSection(path, kSection, &values) == tarq_internal::ReadResult::kFailed) {
        return "cannot read " + path;
    }
    const std::string stray =
        tarq_internal::FindStray(tarq_internal::ReadTextFile(path).value_or(""), kSection,
                                 {"port", "rsync", "ssh", "ssh_options"});
    if (!stray.empty()) {
        return path + ", " + stray;
    }
    const auto value = [&values](const char* key, const std::string& otherwise) {
        std::string text = tarq_internal::ValueOf(values, key);
        return text.empty() ? otherwise : text;
    };
    config->rsync = value("rsync", config->rsync);
    config->ssh = value("ssh", config->ssh);
    std::istringstream words(value("ssh_options", ""));
    for (std::string word; words >> word;) {
        config->ssh_options.push_back(word);
    }
    const std::string port = value("port", std::to_string(config->daemon_port));
    if (!ParsePort(port, &config->daemon_port)) {
        return path + ": port '" + port + "' is not between 1 and 65535";
    }
    return "";
}

}  // namespace Backup
}  // namespace TARQ
