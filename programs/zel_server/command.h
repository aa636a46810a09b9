// The text of a server command, as it arrives from outside.
#pragma once

#include <map>
#include <optional>
#include <string>

namespace zel_server {

/// A command that keeps the rules of docs/server-commands.md.
struct Command {
    std::string name;       ///< such as "ZEL_SyncStart"; any word, known or not
    std::string client_id;  ///< usable, see IsClientId
    std::map<std::string, std::string> params;

    /// The value of `key`, or null when the command has none.
    const std::string* Find(const std::string& key) const;
};

/// The session that the first line names, 32 lower-case hexadecimal digits; nothing when it does
/// not. Only a command with a session can be answered.
std::optional<std::string> ParseSession(const std::string& text);

/// The command behind the session line. Nothing when any line is not key="value", a key is
/// repeated, a value holds a quote or a control character, the first two lines are not `command`
/// and `clientID`, or the text is too long.
std::optional<Command> ParseCommand(const std::string& text);

}  // namespace zel_server
