// Whether a person's section file says only what its reader knows.
#pragma once

#include <set>
#include <string>
#include <string_view>

namespace tarq_internal {

/// The first line of `text` that the reader of one section would pass over, so that a misspelt key
/// is never taken for its default: another section, a key that is not one of `keys`, a section or
/// key that is there twice (the first would count), a line that is neither. "line 7: what is wrong
/// with it", safe on a terminal; empty when there is none. Comments and empty lines are fine.
std::string FindStray(std::string_view text, std::string_view section,
                      const std::set<std::string>& keys);

}  // namespace tarq_internal
