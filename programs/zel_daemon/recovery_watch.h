// Notices that what a run failed for may be over.
#pragma once

#include "base/unique_fd.h"
#include "programs/zel_daemon/file_watch.h"

namespace zel_daemon {

/// What has changed, as far as a run could have waited for it.
enum class Recovery {
    kVolume,   ///< something was mounted or unmounted
    kNetwork,  ///< this machine has another address, route or link than before
    kSettings  ///< the share catalogue, or how the server is reached
};

/// Three descriptors, each of them -1 where the system does not give it: then nothing is noticed
/// there, and what waits is tried when its time comes.
///
/// Threads: one thread.
class RecoveryWatch {
public:
    RecoveryWatch();

    /// Has urgent data (POLLPRI) after a change of the mounts; there is nothing to take in.
    int MountsFd() const { return mounts_.Get(); }
    /// Readable after a change of the network.
    int NetworkFd() const { return network_.Get(); }
    /// Readable when something has happened in the folder of the settings.
    int SettingsFd() const { return settings_.Fd(); }

    /// Take in what is there to read. Whether it is one that matters.
    bool NetworkChanged();
    bool SettingsChanged() { return settings_.Changed(); }

private:
    base::UniqueFd mounts_;
    base::UniqueFd network_;
    FileWatch settings_;
};

}  // namespace zel_daemon
