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

constexpr int kMaxSeconds = 86400;

bool ParseUpTo(int max, const std::string& text, int* number) {
    const char* end = text.data() + text.size();
    const auto [rest, error] = std::from_chars(text.data(), end, *number);
    return error == std::errc() && rest == end && *number >= 1 && *number <= max;
}

}  // namespace

std::string ReadConfig(Config* config) {
    const std::string path = RootPath(kConfigPath);
    tarq_internal::Section values;
    if (tarq_internal::ReadSection(path, kSection, &values) == tarq_internal::ReadResult::kFailed) {
        return "cannot read " + path;
    }
    const std::string stray = tarq_internal::FindStray(
        tarq_internal::ReadTextFile(path).value_or(""), kSection,
        {"port", "rsync", "ssh", "ssh_options", "answer_seconds", "dead_seconds"});
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
    const struct {
        const char* key;
        int max;
        int* number;
    } numbers[] = {{"port", kMaxPort, &config->daemon_port},
                   {"answer_seconds", kMaxSeconds, &config->answer_seconds},
                   {"dead_seconds", kMaxSeconds, &config->dead_seconds}};
    for (const auto& [key, max, number] : numbers) {
        const std::string text = value(key, std::to_string(*number));
        if (!ParseUpTo(max, text, number)) {
            std::string wrong = path + ": " + key;
            wrong += " '" + text + "' is not between 1 and " + std::to_string(max);
            return wrong;
        }
    }
    return "";
}

}  // namespace Backup
}  // namespace TARQ
