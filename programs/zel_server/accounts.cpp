#include "programs/zel_server/accounts.h"

#include <sys/random.h>

#include <algorithm>
#include <cerrno>
#include <sstream>

#include "base/replace_file.h"
#include "base/whole_file.h"
#include "programs/common/failure.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

namespace {

constexpr size_t kMaxSecrets = 4194304;
constexpr size_t kPasswordLength = 20;
constexpr size_t kShortestPassword = 10;
// 32 characters, so that a random byte selects each with the same probability; without l, 1, o and
// 0, which are easily confused.
constexpr char kPasswordCharacters[] = "abcdefghijkmnpqrstuvwxyz23456789";
static_assert(sizeof kPasswordCharacters - 1 == 32);

// Prefix of the line of a disabled account; to the rsync daemon it is a comment.
constexpr char kDisabled[] = "# disabled: ";
constexpr size_t kDisabledLength = sizeof kDisabled - 1;

// A line of the file. Lines that are not of an account have no name, and are kept unchanged.
struct Line {
    std::string name;
    bool enabled = true;
    std::string rest;  // for an account: the password

    explicit Line(const std::string& text) : rest(text) {
        enabled = text.compare(0, kDisabledLength, kDisabled) != 0;
        const std::string entry = enabled ? text : text.substr(kDisabledLength);
        const size_t colon = entry.find(':');
        if (colon != std::string::npos && colon > 0 && entry.front() != '#') {
            name = entry.substr(0, colon);
            rest = entry.substr(colon + 1);
        }
    }
    std::string Text() const {
        return name.empty() ? rest : (enabled ? "" : kDisabled) + name + ":" + rest;
    }
};

using Lines = std::vector<Line>;

// Nothing when the file exists but cannot be read.
std::optional<Lines> ReadLines() {
    Lines lines;
    const auto content = base::ReadFile(SecretsFile(), kMaxSecrets);
    if (!content) {
        return errno == ENOENT ? std::optional<Lines>(lines) : std::nullopt;
    }
    std::istringstream stream(*content);
    for (std::string line; std::getline(stream, line);) {
        lines.emplace_back(line);
    }
    return lines;
}

bool WriteLines(const Lines& lines) {
    std::string content;
    for (const Line& line : lines) {
        content += line.Text() + "\n";
    }
    return base::ReplaceFile(SecretsFile(), content, 0600);
}

Lines::iterator Find(Lines& lines, const std::string& name) {
    return std::find_if(lines.begin(), lines.end(),
                        [&](const Line& line) { return line.name == name; });
}

// Applies `change(lines, line)` to the account's line; ENOENT when it has none.
template <typename Change>
bool ChangeLine(const std::string& name, Change change) {
    auto lines = ReadLines();
    if (!lines) {
        return false;
    }
    const auto line = Find(*lines, name);
    if (line == lines->end()) {
        errno = ENOENT;
        return false;
    }
    change(*lines, line);
    return WriteLines(*lines);
}

}  // namespace

std::optional<std::vector<Account>> Accounts() {
    const auto lines = ReadLines();
    if (!lines) {
        return std::nullopt;
    }
    std::vector<Account> accounts;
    for (const Line& line : *lines) {
        if (!line.name.empty()) {
            accounts.push_back({line.name, line.enabled, !IsLongEnough(line.rest)});
        }
    }
    return accounts;
}

bool MayLogIn(const std::string& name) {
    auto lines = ReadLines();
    const auto line = lines ? Find(*lines, name) : Lines::iterator();
    return lines && line != lines->end() && line->enabled;
}

bool SetAccount(const std::string& name, const std::string& password) {
    auto lines = ReadLines();
    if (!lines) {
        return false;
    }
    const auto line = Find(*lines, name);
    if (line != lines->end()) {
        line->rest = password;
    } else {
        lines->emplace_back(name + ":" + password);
    }
    return WriteLines(*lines);
}

bool RemoveAccount(const std::string& name) {
    return ChangeLine(name, [](Lines& lines, Lines::iterator line) { lines.erase(line); });
}

bool EnableAccount(const std::string& name, bool enabled) {
    return ChangeLine(name, [&](Lines&, Lines::iterator line) { line->enabled = enabled; });
}

std::string MakePassword() {
    unsigned char bytes[kPasswordLength];
    if (getrandom(bytes, sizeof bytes, 0) != static_cast<ssize_t>(sizeof bytes)) {
        throw programs::SystemFailure("the system has no random bytes for a password");
    }
    std::string password;
    for (const unsigned char byte : bytes) {
        password += kPasswordCharacters[byte % (sizeof kPasswordCharacters - 1)];
    }
    return password;
}

bool IsLongEnough(const std::string& password) {
    return password.size() >= kShortestPassword;
}

}  // namespace zel_server
