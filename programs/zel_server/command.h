// Parser for the text of a server command, which is untrusted input.
#pragma once

#include <map>
#include <optional>
#include <string>

namespace zel_server {

/// A command that follows the rules of docs/server-commands.md.
struct Command {
    std::string name;       ///< such as "ZEL_SyncStart"; may be unknown
    std::string client_id;  ///< valid, see IsClientId
    std::map<std::string, std::string> params;

    /// The value of `key`, or null when the command has none.
    const std::string* Find(const std::string& key) const;
};

/// The session in the first line, 32 lower-case hexadecimal digits; nothing when there is none.
/// Only a command with a session can be answered.
std::optional<std::string> ParseSession(const std::string& text);

/// The command after the session line. Nothing when any line is not key="value", a key is repeated,
/// a value contains a quote or a control character, the first two lines are not `command` and
/// `clientID`, or the text is too long.
std::optional<Command> ParseCommand(const std::string& text);

}  // namespace zel_server
