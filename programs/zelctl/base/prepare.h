#pragma once

namespace zelctl {

/// Creates the folders that the library expects but a package may not have created: for the
/// configuration, and for temporary files, which no other user may be able to change.
void PrepareHost();

}  // namespace zelctl
