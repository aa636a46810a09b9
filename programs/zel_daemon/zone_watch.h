#pragma once

#include <string>

#include "base/unique_fd.h"

namespace zel_daemon {

/// Notices that the machine's time zone was changed, which no signal tells.
class ZoneWatch {
public:
    /// Without inotify it notices nothing.
    ZoneWatch();

    /// Readable when something has happened beside the zone's file; -1: never.
    int Fd() const { return fd_.Get(); }
    /// Takes that in. Whether the zone may be another one now.
    bool Changed();

private:
    base::UniqueFd fd_;
};

}  // namespace zel_daemon
