// The folder of a share, held open for a run.
#pragma once

#include <string>

#include "base/unique_fd.h"

namespace programs {

/// What a run reads is the folder that was opened and checked, whatever is mounted, unmounted or
/// renamed at its path meanwhile: nothing of that looks like a deletion.
class OpenShare {
public:
    /// Opens the folder of `share`, which the catalogue has at `path`, and checks that it is the
    /// share's. Throws RunFailure (Reach::kShare).
    OpenShare(const std::string& share, const std::string& path);

    int Fd() const { return folder_.Get(); }
    /// A path of the folder, for as long as this lives and for this process alone.
    const std::string& Path() const { return path_; }

private:
    base::UniqueFd folder_;
    std::string path_;
};

/// Throws RunFailure (Reach::kShare) when the share cannot be pushed.
void CheckShare(const std::string& share);

}  // namespace programs
