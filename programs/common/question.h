// What only a person may allow: a share's push that would lose much, or that may go to the wrong
// copy, does not go on until somebody says so.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace programs {

/// What a person is asked about one share, before anything was changed.
struct Question {
    std::string reason;   ///< a word for programs: "losses"
    std::string text;     ///< a sentence: which share, what would happen, and why that is asked
    uint64_t amount = 0;  ///< of what would be lost; a consent holds for no more
    std::vector<std::string> list;  ///< the first of it, a printable line each
};

/// A person's answer, for one push. It holds for a question of the same reason, and for as much as
/// the person was shown.
struct Consent {
    std::string reason;
    uint64_t amount = 0;
};

}  // namespace programs
