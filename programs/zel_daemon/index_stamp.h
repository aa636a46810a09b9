// With which state of a copy an index is in step.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "programs/common/share_notes.h"

namespace zel_daemon {

/// A push notes on this machine's disk that it begins, before the server hears of it, and how it
/// has ended (programs/common/share_notes.h). So where these notes are still those of the stamp,
/// nobody has pushed from here since, and no push was cut off.
struct IndexStamp {
    std::string settings;  ///< the server, the account and what is excluded, see SettingsOf()
    programs::KnownCopy copy;
    std::vector<std::string> begun;  ///< as in the notes
    int64_t compared = 0;            ///< when all was last compared, in seconds since the epoch
};

/// Whether what the notes and settings say now is what they said when the index was in step.
bool IsInStep(const IndexStamp& stamp, const programs::ShareNotes& now,
              const std::string& settings);

/// The copy as the push with this mark has left it, from the notes before and after it. Nothing
/// when it is not known, or when somebody else has pushed meanwhile. `known`: the copy as it was
/// before, if it was known: it stays so when the push did not come to it.
std::optional<programs::KnownCopy> CopyAfter(const programs::ShareNotes& before,
                                             const programs::ShareNotes& after,
                                             const std::string& mark,
                                             const std::optional<programs::KnownCopy>& known);

}  // namespace zel_daemon
