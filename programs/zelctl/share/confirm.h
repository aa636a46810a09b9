// Whether a path means the same folder to the person, to the daemon and to the catalogue.
#pragma once

#include <string>

namespace zelctl {

/// How the daemon's view of the folder at `path` differs, and what to do about it. Empty when it
/// sees the same folder and can read it, or when it is not running.
std::string DaemonsViewOf(const std::string& path);

}  // namespace zelctl
