#include "programs/zel_server/accounts.h"

#include <algorithm>
#include <cerrno>
#include <sstream>

#include "ZEL/zel.h"
#include "base/replace_file.h"
#include "base/whole_file.h"
#include "programs/common/text.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

namespace {

constexpr size_t kMaxSecrets = 4194304;

// The file's lines, comments included; nothing when it is there and cannot be read.
std::optional<std::vector<std::string>> ReadLines() {
    std::vector<std::string> lines;
    if (!ZEL::IsPathExist(SecretsFile())) {
        return lines;
    }
    const auto content = base::ReadFile(SecretsFile(), kMaxSecrets);
    if (!content) {
        return std::nullopt;
    }
    std::istringstream stream(*content);
    for (std::string line; std::getline(stream, line);) {
        lines.push_back(line);
    }
    return lines;
}

bool WriteLines(const std::vector<std::string>& lines) {
    std::string content;
    for (const std::string& line : lines) {
        content += line + "\n";
    }
    return base::ReplaceFile(SecretsFile(), content, 0600);
}

bool IsLineOf(const std::string& line, const std::string& name) {
    return line.compare(0, name.size() + 1, name + ":") == 0;
}

}  // namespace

std::optional<std::vector<std::string>> Accounts() {
    const auto lines = ReadLines();
    if (!lines) {
        return std::nullopt;
    }
    std::vector<std::string> names;
    for (const std::string& line : *lines) {
        const size_t colon = line.find(':');
        if (colon != std::string::npos && colon > 0 && line.front() != '#') {
            names.push_back(line.substr(0, colon));
        }
    }
    return names;
}

bool SetAccount(const std::string& name, const std::string& password) {
    auto lines = ReadLines();
    if (!lines) {
        return false;
    }
    const std::string entry = name + ":" + password;
    const auto found = std::find_if(lines->begin(), lines->end(),
                                    [&](const std::string& line) { return IsLineOf(line, name); });
    if (found != lines->end()) {
        *found = entry;
    } else {
        lines->push_back(entry);
    }
    return WriteLines(*lines);
}

bool RemoveAccount(const std::string& name) {
    auto lines = ReadLines();
    if (!lines) {
        return false;
    }
    const auto kept = std::remove_if(lines->begin(), lines->end(),
                                     [&](const std::string& line) { return IsLineOf(line, name); });
    if (kept == lines->end()) {
        errno = ENOENT;
        return false;
    }
    lines->erase(kept, lines->end());
    return WriteLines(*lines);
}

}  // namespace zel_server
