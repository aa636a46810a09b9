// What was moved within a share is moved at the server, too, before a push compares anything: what
// it holds need not be sent again.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "programs/common/present_paths.h"
#include "programs/common/server_session.h"

namespace programs {

/// What one command tells.
struct ToldMoves {
    std::string paths;          ///< "FROM TO FROM TO ..."
    std::vector<size_t> moves;  ///< by their place in the order
};

/// The moves of the order whose outcome is still in the share's `folder` and which `excludes`
/// leaves alone, in as many commands as their names need: each has at most `bytes` of them.
std::vector<ToldMoves> MovesToTell(const ShareOrder& share, const std::string& folder,
                                   const std::vector<std::string>& excludes, size_t bytes);

/// Has the server make those moves. Returns which of them it has made. The others are for the push
/// to send: none of this is a failure, unless the server cannot be reached any more (RunFailure).
/// Nothing: the server knows no moves.
std::optional<std::vector<bool>> SendMoves(ServerSession& session, const ShareOrder& share,
                                           const std::string& folder,
                                           const std::vector<std::string>& excludes);

/// The brake of what is left to send when the server has made these moves: of a folder that it
/// moves nothing is lost but what is sent of it.
Brake BrakeAfter(const ShareOrder& share, const std::vector<bool>& made);

/// The paths that are left to send then: in place of a folder what ShareMove::instead says.
std::vector<PresentPath> PathsAfter(std::vector<PresentPath> paths, const ShareOrder& share,
                                    const std::vector<bool>& made);

}  // namespace programs
