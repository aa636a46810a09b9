#include "programs/zel_server/version_turn.h"

#include <syslog.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include "programs/zel_server/file_tree.h"
#include "programs/zel_server/partial_store.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/registry_repair.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/version_keeper.h"
#include "programs/zel_server/version_retention.h"
#include "programs/zel_server/version_space.h"

namespace zel_server {

void KeepVersions() {
    AllowManyFiles();
    const auto settings = ReadKeepSettings();
    if (!settings) {
        syslog(LOG_WARNING,
               "zel_server: how long versions are kept cannot be read in %s: none is "
               "given up. 'zel_server setup --keep' sets it anew",
               ConfigFile().c_str());
    }
    for (const std::string& share : KnownShares().value_or(std::vector<std::string>())) {
        ShareState state;
        if (ReadShare(share, state) != ReadResult::kRead || state.path.empty()) {
            continue;
        }
        {
            const RegistryLock lock;
            if (!lock.Held() || !TakeVersions(share, state.path)) {
                syslog(LOG_WARNING, "zel_server: cannot take the versions of share [%s]: %s",
                       share.c_str(), strerror(errno));
            }
            if (lock.Held()) {
                RemoveStalePartials(share, state.path);
            }
        }
        if (settings &&
            !ThinVersions(VersionsOf(share, state.path), settings->retention, VersionTime::Now())) {
            syslog(LOG_WARNING, "zel_server: cannot thin the versions of share [%s]: %s",
                   share.c_str(), strerror(errno));
        }
    }
    if (settings) {
        PayForSpace(*settings);
    }
}

void GiveUpForSpace() {
    AllowManyFiles();
    if (const auto settings = ReadKeepSettings()) {
        PayForSpace(*settings);
    }
}

}  // namespace zel_server
