// The command by which a client has its server rename what was renamed at the client.
#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "programs/zel_server/answers.h"
#include "programs/zel_server/request.h"

namespace zel_server {

using Moves = std::vector<std::pair<std::string, std::string>>;

/// The moves that a command tells; none when it tells none. Nothing for a text that is no list of
/// them.
std::optional<Moves> ParseMoves(const Command& command);

/// Makes them in the copy at `path`, as far as they can be made, and returns which were. None where
/// others write there. Called with the registry's lock held.
std::vector<bool> MakeMovesQuietly(const std::string& share, const std::string& path,
                                   const Moves& moves);

/// Makes moves in the copy of a share that this client and account are pushing. What cannot be made
/// is no failure: the push sends what is left to do. Called with the registry's lock held.
Answer MoveInShare(const Request& request);

}  // namespace zel_server
