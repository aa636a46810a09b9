// The commands that make a share readable: as it is, and as it stood at a time.
#pragma once

#include "programs/zel_server/answers.h"
#include "programs/zel_server/request.h"

namespace zel_server {

/// Opens a module of its own for reading the share or comparing with it. Any client that knows the
/// account's password may do that, for example a machine that replaces the one that pushed. Called
/// with the registry's lock held.
Answer OpenShare(const Request& request);

/// Opens a module that shows a part of the share as it stood at a time.
Answer OpenShareAt(const Request& request);
/// Closes it.
Answer CloseShareAt(const Request& request);
/// Tells when the share, or what is at a path of it, has changed.
Answer ListShareVersions(const Request& request);

}  // namespace zel_server
