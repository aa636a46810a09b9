#include "programs/zel_server/move_command.h"

#include "programs/common/server_status.h"
#include "programs/common/share_path.h"
#include "programs/zel_server/command_paths.h"
#include "programs/zel_server/copy_moves.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/share_copy.h"
#include "programs/zel_server/share_module.h"
#include "programs/zel_server/share_record.h"
#include "programs/zel_server/storage.h"
#include "programs/zel_server/version_keeper.h"

namespace zel_server {

using namespace programs;

// "FROM TO FROM TO ..."
std::optional<Moves> ParseMoves(const Command& command) {
    const auto paths = ParsePaths(command.Find("moves"));
    if (!paths || paths->size() % 2 != 0) {
        return std::nullopt;
    }
    Moves moves;
    for (size_t i = 0; i < paths->size(); i += 2) {
        if (!IsMovableInShare((*paths)[i]) || !IsMovableInShare((*paths)[i + 1])) {
            return std::nullopt;
        }
        moves.emplace_back((*paths)[i], (*paths)[i + 1]);
    }
    return moves;
}

// What was changed before becomes a version first: it has the names of before.
std::vector<bool> MakeMovesQuietly(const std::string& share, const std::string& path,
                                   const Moves& moves) {
    return TransfersInto(share).empty() && TakeVersions(share, path)
               ? MakeMoves(share, path, moves)
               : std::vector<bool>(moves.size(), false);
}

Answer MoveInShare(const Request& request) {
    const std::string* const share = request.command.Find("shareName");
    const auto moves = ParseMoves(request.command);
    if (share == nullptr || !IsShareName(*share) || !moves || moves->empty() ||
        request.command.Find("outfile") == nullptr) {
        return {kBadArgument, ""};
    }
    ShareState state;
    const ReadResult read = ReadShare(*share, state);
    if (read == ReadResult::kFailed || read == ReadResult::kDamaged) {
        return {kRegistryRead, ""};
    }
    const auto open = FindModule(state.module);
    if (state.running_id != request.Client() || state.account != request.account || !open ||
        open->share != *share || open->client != request.Client() ||
        open->account != request.account) {
        return {kNotRunning, ""};
    }
    if (CheckStorage(request.config, FolderAbove(state.path)) != StorageState::kReady ||
        LookAtCopy(RecordedCopy(*share), state.path) != CopyFolder::kSame) {
        return {kStorage, ""};
    }
    KeepOpen(*share, request.Client(), request.account);
    std::string made;
    for (const bool is_made : MakeMovesQuietly(*share, state.path, *moves)) {
        made += is_made ? '1' : '0';
    }
    return {kDone, "moved=\"" + made + "\"\n"};
}

}  // namespace zel_server
