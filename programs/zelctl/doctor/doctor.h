// Looks at all that a push needs, and says how to mend what is wrong.
#pragma once

namespace zelctl {

/// Prints what it finds; fails (kLocal) when anything of it has failed.
void Doctor(bool as_json);

}  // namespace zelctl
