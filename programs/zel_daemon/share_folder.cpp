#include "programs/zel_daemon/share_folder.h"

#include <fcntl.h>

#include "base/open_beneath.h"
#include "programs/common/failure.h"

namespace zel_daemon {

using base::UniqueFd;

UniqueFd OpenShareFolder(const std::string& folder) {
    UniqueFd share(open(folder.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!share) {
        throw programs::SystemFailure("cannot open " + folder, programs::FailureKind::kLocal);
    }
    return share;
}

std::optional<EntryFacts> FactsAt(const UniqueFd& share, const std::string& path) {
    const LookTime look;
    const UniqueFd entry = base::OpenBeneath(share.Get(), path.substr(1), O_PATH | O_NOFOLLOW);
    return entry ? FactsOf(entry.Get(), "", look) : std::nullopt;
}

}  // namespace zel_daemon
