// Which names from outside may become file names, section names and lines of a configuration file.
#pragma once

#include <string>

namespace zel_server {

/// 1 to 80 bytes; no control character, none of / \ : " [ ] = %, no leading dot, no blank at an
/// end, and no name that the rsync daemon keeps for itself.
bool IsShareName(const std::string& name);

/// 1 to 64 bytes; letters, digits, and . _ - @ + in places where no file format gives them a
/// meaning.
bool IsAccountName(const std::string& name);

/// 1 to 35 bytes (the registry compares no more); printable ASCII without blanks, quotes, brackets
/// and slashes.
bool IsClientId(const std::string& id);

/// 1 to 64 bytes without control characters or quotes: the name under which a client knows this
/// server.
bool IsServerName(const std::string& name);

/// Whether the client's volume name is a plain word; an empty one, and one with slashes, as nested
/// mounts have it, name no volume here but are no offence either. False for what no mount is ever
/// called.
bool IsHarmlessVolumeName(const std::string& name);

/// The rsync daemon tells its modules apart by this form only: letters folded, blanks dropped.
std::string ModuleKey(const std::string& name);

}  // namespace zel_server
