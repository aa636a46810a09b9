#pragma once

namespace zelctl {

/// Makes the folders that the library expects of its host and no package may have made: for the
/// configuration, and for scratch files, which must be nobody else's to change.
void PrepareHost();

}  // namespace zelctl
