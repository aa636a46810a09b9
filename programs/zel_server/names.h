// Which names from outside may be used as file names, section names and lines of a configuration
// file.
#pragma once

#include <string>

namespace zel_server {

/// 1 to 80 bytes; no control characters, none of / \ : " [ ] = %, no leading dot, @ or #, no
/// leading, trailing or repeated blanks, and no name that is reserved by the rsync daemon.
bool IsShareName(const std::string& name);

/// 1 to 64 bytes: letters, digits, and . _ - @ + in positions where no file format gives them a
/// meaning.
bool IsAccountName(const std::string& name);

/// In the registry, takes the place of a client's identity when several are paired; no client has
/// it.
inline constexpr char kMultiSourceMarker[] = "ZELMULTI-SRC-SUPPORT";

/// 1 to 35 bytes (the registry compares no more) of printable ASCII without blanks, quotes,
/// brackets and slashes; not the marker.
bool IsClientId(const std::string& id);

/// The client's name for this server: 1 to 64 bytes without control characters or quotes.
bool IsServerName(const std::string& name);

/// Whether the client's volume name is acceptable. An empty name, and one with slashes (a nested
/// mount), are accepted but select no volume here. False for what cannot be the name of a mount.
bool IsHarmlessVolumeName(const std::string& name);

/// The form in which the rsync daemon compares module names: case folded, blanks removed.
std::string ModuleKey(const std::string& name);

}  // namespace zel_server
