#include "platform/tarqrsync/settings.h"

#include <algorithm>
#include <string_view>

#include "base/rsync_config.h"
#include "base/text.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr std::string_view kOutfilePrefix = "outfile=\"";
// rsync cuts a longer password off without a word.
constexpr size_t kMaxPasswordBytes = 511;

bool HasControl(const std::string& text) {
    return std::any_of(text.begin(), text.end(),
                       [](char c) { return static_cast<unsigned char>(c) < 0x20 || c == 0x7f; });
}

bool HasAny(const std::string& text, const char* unwanted) {
    return text.find_first_of(unwanted) != std::string::npos;
}

bool HasNul(const std::string& text) {
    return text.find('\0') != std::string::npos;
}

bool HasParentStep(const std::string& path) {
    return ("/" + path + "/").find("/../") != std::string::npos;
}

// Relative, and nowhere else than below the folder that it is relative to.
bool IsPathWithin(const std::string& path) {
    return path.compare(0, 1, "/") != 0 && !HasNul(path) && !HasParentStep(path);
}

std::string RefusalOfAccount(const Settings& settings) {
    if (settings.user.empty() && settings.account && settings.account_required) {
        return "no account is given to log in with";
    }
    if (HasControl(settings.user) || HasAny(settings.user, " :/[]") ||
        settings.user.compare(0, 1, "-") == 0) {
        return "the account name holds characters that no rsync account can have";
    }
    if (HasControl(settings.password)) {
        return "the password holds control characters";
    }
    if (settings.password.size() > kMaxPasswordBytes) {
        return "the password is longer than " + std::to_string(kMaxPasswordBytes) + " bytes";
    }
    return "";
}

std::string RefusalOfCommand(const Settings& settings) {
    if (settings.command.empty()) {
        return "the command has no lines";
    }
    if (std::any_of(settings.command.begin(), settings.command.end(), HasControl)) {
        return "a line of the command holds a line break or another control character";
    }
    return "";
}

std::string RefusalOfCopy(const Settings& settings) {
    if (settings.module.empty()) {
        return "no module is given to copy to";
    }
    const bool directory = settings.module[0] == '/';
    if (HasControl(settings.module) || settings.module[0] == '-' ||
        (!directory && HasAny(settings.module, ":[]")) || HasParentStep(settings.module)) {
        return "the module name '" + settings.module + "' cannot be one";
    }
    if (HasControl(settings.sub_path) || settings.sub_path.compare(0, 1, "-") == 0 ||
        HasParentStep(settings.sub_path)) {
        return "the path below the module holds a control character or '..', or begins with '-'";
    }
    if (!settings.list_only && settings.source.empty()) {
        return "no source is given to copy from";
    }
    if (HasNul(settings.source) ||
        std::any_of(settings.exclude_rules.begin(), settings.exclude_rules.end(), HasNul)) {
        return "the source or an exclude rule holds a NUL byte";
    }
    for (const std::string& path : settings.pull.value_or(PullOptions()).paths) {
        if (path.empty() || !IsPathWithin(path)) {
            return "a path to bring back is empty, begins with '/', or holds '..' or a NUL byte";
        }
    }
    return "";
}

}  // namespace

bool IsHost(const std::string& host) {
    return !host.empty() && host[0] != '-' && std::all_of(host.begin(), host.end(), [](char c) {
        return base::IsLetterOrDigit(c) || c == '.' || c == '-' || c == '_' || c == ':' || c == '%';
    });
}

std::string RefusalOf(const Settings& settings) {
    if (!IsHost(settings.host)) {
        return "'" + settings.host + "' is neither a host name nor an address";
    }
    if (settings.port < 0 || settings.port > base::kMaxPort) {
        return "the port " + std::to_string(settings.port) + " is not between 1 and 65535";
    }
    if (settings.timeout < 0) {
        return "the time-out is negative";
    }
    std::string refusal = RefusalOfAccount(settings);
    if (!refusal.empty()) {
        return refusal;
    }
    return settings.is_command ? RefusalOfCommand(settings) : RefusalOfCopy(settings);
}

std::string RefusalOf(const RunOptions& options) {
    for (const auto* const paths : {&options.changes, &options.files}) {
        if (!std::all_of(paths->begin(), paths->end(), IsPathWithin)) {
            return "a path of the source begins with '/', or holds '..' or a NUL byte";
        }
    }
    if (std::any_of(options.start.begin(), options.start.end(), HasControl)) {
        return "a line of the start holds a line break or another control character";
    }
    return "";
}

std::string OutfileOf(const std::list<std::string>& command) {
    for (const std::string& line : command) {
        if (line.compare(0, kOutfilePrefix.size(), kOutfilePrefix) == 0 && line.back() == '"' &&
            line.size() > kOutfilePrefix.size()) {
            return line.substr(kOutfilePrefix.size(), line.size() - kOutfilePrefix.size() - 1);
        }
    }
    return "";
}

}  // namespace Backup
}  // namespace TARQ
