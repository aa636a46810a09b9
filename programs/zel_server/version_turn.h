// What `zel_server serve` has done now and then, in a process of its own at the lowest priority.
#pragma once

namespace zel_server {

/// For each share of the server: takes what interrupted connections have left, and thins. Then
/// gives up versions where space is short (version_space.h).
void KeepVersions();

/// The latter alone.
void GiveUpForSpace();

}  // namespace zel_server
