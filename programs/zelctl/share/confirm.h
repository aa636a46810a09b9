// Whether everybody means the same folder: the person, the daemon, and the catalogue.
#pragma once

#include <string>

namespace zelctl {

/// What the daemon sees otherwise at `path`, and what to do about it; empty when it sees the same
/// folder and can read it, or does not run.
std::string DaemonsViewOf(const std::string& path);

}  // namespace zelctl
