// Checks everything that a push needs, and says how to solve the problems found.
#pragma once

namespace zelctl {

/// Prints the findings; throws Failure (kLocal) when one of them is a failure.
void Doctor(bool as_json);

}  // namespace zelctl
