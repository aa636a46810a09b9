#pragma once

#include "base/unique_fd.h"

namespace zel_daemon {

/// Goes on in the background, in a session of its own, while the process that was started waits
/// until Ready() or the end, and exits accordingly. Before any thread is started.
class Background {
public:
    /// Returns in the background process alone. Throws std::system_error.
    Background();
    /// The one who started the daemon may go on.
    void Ready();

private:
    base::UniqueFd ready_;
};

}  // namespace zel_daemon
