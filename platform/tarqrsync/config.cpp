#include "platform/tarqrsync/config.h"

#include <charconv>
#include <sstream>

#include "tarq/owners.h"
#include "tarq/root_path.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr char kConfigPath[] = "/usr/tarq/etc/tarqrsync.conf";
constexpr char kSection[] = "rsync";
constexpr int kMaxPort = 65535;

bool ParsePort(const std::string& text, int* port) {
    const char* end = text.data() + text.size();
    const auto [rest, error] = std::from_chars(text.data(), end, *port);
    return error == std::errc() && rest == end && *port >= 1 && *port <= kMaxPort;
}

}  // namespace

std::string ReadConfig(Config* config) {
    const std::string path = RootPath(kConfigPath);
    if (!KAPICFileExist(path.c_str())) {
        return "";
    }
    const HashOwner values(KAPICSzHashAlloc(4));
    if (!values || KAPICFileGetSection(path.c_str(), kSection, values.get()) < 0) {
        return "cannot read " + path;
    }
    const auto value = [&values](const char* key, const std::string& otherwise) -> std::string {
        const char* text = KAPICSzHashGetValue(values.get(), key);
        return text && *text ? text : otherwise;
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
