#include "programs/zel_server/command.h"

#include <algorithm>
#include <string_view>

#include "base/random_digits.h"
#include "base/text.h"
#include "programs/zel_server/names.h"
#include "tarq/rsync_wrapper.h"

namespace zel_server {

namespace {

struct KeyValue {
    std::string_view key;
    std::string_view value;
};

bool IsKey(std::string_view key) {
    return !key.empty() && std::all_of(key.begin(), key.end(), base::IsLetter);
}

bool IsValue(std::string_view value) {
    for (const char c : value) {
        const unsigned char byte = static_cast<unsigned char>(c);
        if (byte < 0x20 || byte == 0x7f || byte == '"') {
            return false;
        }
    }
    return true;
}

// Removes the next line from `rest`; nothing when it is not key="value".
std::optional<KeyValue> NextLine(std::string_view& rest) {
    const size_t end = rest.find('\n');
    const std::string_view line = rest.substr(0, end);
    rest.remove_prefix(end == std::string_view::npos ? rest.size() : end + 1);

    const size_t opening = line.find("=\"");
    if (opening == std::string_view::npos || line.size() < opening + 3 || line.back() != '"') {
        return std::nullopt;
    }
    const std::string_view key = line.substr(0, opening);
    const std::string_view value = line.substr(opening + 2, line.size() - opening - 3);
    if (!IsKey(key) || !IsValue(value)) {
        return std::nullopt;
    }
    return KeyValue{key, value};
}

std::optional<KeyValue> SessionLine(std::string_view& rest) {
    const std::optional<KeyValue> line = NextLine(rest);
    if (!line || line->key != "session" || !base::AreRandomDigits(line->value)) {
        return std::nullopt;
    }
    return line;
}

}  // namespace

const std::string* Command::Find(const std::string& key) const {
    const auto found = params.find(key);
    return found == params.end() ? nullptr : &found->second;
}

std::optional<std::string> ParseSession(const std::string& text) {
    std::string_view rest = text;
    const std::optional<KeyValue> line = SessionLine(rest);
    return line ? std::optional<std::string>(line->value) : std::nullopt;
}

std::optional<Command> ParseCommand(const std::string& text) {
    std::string_view rest = text;
    if (text.size() > TARQ::Backup::kMaxCommandBytes || !SessionLine(rest)) {
        return std::nullopt;
    }
    Command command;
    for (size_t number = 0; !rest.empty(); ++number) {
        const std::optional<KeyValue> line = NextLine(rest);
        if (!line) {
            return std::nullopt;
        }
        const std::string key(line->key);
        if ((number == 0) != (key == "command") || (number == 1) != (key == "clientID") ||
            key == "session") {
            return std::nullopt;
        }
        if (number == 0) {
            command.name = line->value;
        } else if (number == 1) {
            command.client_id = line->value;
        } else if (!command.params.emplace(key, line->value).second) {
            return std::nullopt;
        }
    }
    if (command.name.empty() || !IsClientId(command.client_id)) {
        return std::nullopt;
    }
    return command;
}

}  // namespace zel_server
