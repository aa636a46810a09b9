#include "programs/common/share_moves.h"

#include <fcntl.h>
#include <fnmatch.h>

#include <algorithm>
#include <string_view>
#include <unordered_map>
#include <utility>

#include "base/open_beneath.h"
#include "base/percent.h"
#include "base/section_view.h"
#include "base/unique_fd.h"
#include "programs/common/mounts_below.h"
#include "programs/common/server_status.h"
#include "programs/common/share_path.h"
#include "programs/common/share_start.h"

namespace programs {

namespace {

// Of the paths in one command, which has room for 5 KiB.
constexpr size_t kMaxPathBytes = size_t{4} * 1024;
constexpr char kPlainInPaths[] = "/.-_";

// Whether a rule may concern the path or a folder above it: what is excluded is not at the server,
// or is none of the push's business there. A rule with a "/" within may concern anything.
bool MayBeExcluded(const std::string& path, const std::vector<std::string>& rules) {
    return std::any_of(rules.begin(), rules.end(), [&path](const std::string& rule) {
        const std::string name = rule.substr(0, rule.find_last_not_of('/') + 1);
        bool concerned = name.find('/') != std::string::npos;
        for (size_t begin = 0; begin < path.size() && !concerned;) {
            const size_t end = std::min(path.find('/', begin), path.size());
            concerned = fnmatch(name.c_str(), path.substr(begin, end - begin).c_str(), 0) == 0;
            begin = end + 1;
        }
        return concerned;
    });
}

// Where `path` has gone with the moves from `next` on.
std::string PlaceAfter(std::string path, const std::vector<ShareMove>& moves, size_t next) {
    for (; next < moves.size(); ++next) {
        if (IsAtOrBelow(path, moves[next].from)) {
            path.replace(0, moves[next].from.size(), moves[next].to);
        }
    }
    return path;
}

// One for each move of a command, in its order: "1" was made.
std::string DigitsIn(const std::string& answer) {
    const auto line = base::ParseKeyLine(std::string_view(answer).substr(0, answer.find('\n')));
    return line && line->key == "moved" ? std::string(line->value) : "";
}

bool IsThere(const base::UniqueFd& folder, const std::string& path) {
    return static_cast<bool>(base::OpenBeneath(folder.Get(), path.substr(1), O_PATH));
}

}  // namespace

std::vector<ToldMoves> MovesToTell(const ShareOrder& share, const std::string& folder,
                                   const std::vector<std::string>& excludes, size_t bytes) {
    const base::UniqueFd top(open(folder.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    std::vector<ToldMoves> commands;
    for (size_t i = 0; top && i < share.moves.size(); ++i) {
        const std::string& from = share.moves[i].from;
        const std::string& to = share.moves[i].to;
        if (!IsMovableInShare(from.substr(1)) || !IsMovableInShare(to.substr(1)) ||
            MayBeExcluded(from, excludes) || MayBeExcluded(to, excludes) ||
            !IsThere(top, PlaceAfter(to, share.moves, i + 1))) {
            continue;
        }
        const std::string words = base::PercentEncoded(from.substr(1), kPlainInPaths) + " " +
                                  base::PercentEncoded(to.substr(1), kPlainInPaths);
        if (words.size() > bytes) {
            continue;
        }
        if (commands.empty() || commands.back().paths.size() + 1 + words.size() > bytes) {
            commands.emplace_back();
        }
        ToldMoves& command = commands.back();
        command.paths += (command.paths.empty() ? "" : " ") + words;
        command.moves.push_back(i);
    }
    return commands;
}

std::optional<std::vector<bool>> SendMoves(ServerSession& session, const ShareOrder& share,
                                           const std::string& folder,
                                           const std::vector<std::string>& excludes) {
    std::vector<bool> made(share.moves.size(), false);
    for (const ToldMoves& command : MovesToTell(share, folder, excludes, kMaxPathBytes)) {
        std::string answer;
        const int status =
            session.Ask("ZEL_Move", share.share, {"moves=\"" + command.paths + "\""}, answer);
        if (status == kUnknownCommand) {
            return std::nullopt;
        }
        if (session.cancel || (status != kDone && status < kFirstServerStatus)) {
            throw session.Failed(QuotedShare(share.share) + ": what was moved cannot be told",
                                 status, ReachOfCommand(status));
        }
        const std::string digits = status == kDone ? DigitsIn(answer) : "";
        for (size_t i = 0; i < std::min(command.moves.size(), digits.size()); ++i) {
            made[command.moves[i]] = digits[i] == '1';
        }
    }
    return made;
}

Brake BrakeAfter(const ShareOrder& share, const std::vector<bool>& made) {
    Brake brake = share.brake;
    for (size_t i = 0; i < share.moves.size(); ++i) {
        const ShareMove& move = share.moves[i];
        if (made[i] && !move.instead.empty() && brake.folders.erase(move.from) != 0 &&
            brake.at_most) {
            *brake.at_most += move.instead.size();
        }
    }
    return brake;
}

std::vector<PresentPath> PathsAfter(std::vector<PresentPath> paths, const ShareOrder& share,
                                    const std::vector<bool>& made) {
    std::unordered_map<std::string, const ShareMove*> less;  // by where they went
    for (size_t i = 0; i < share.moves.size(); ++i) {
        if (made[i] && !share.moves[i].instead.empty()) {
            less.emplace(share.moves[i].to, &share.moves[i]);
        }
    }
    if (less.empty()) {
        return paths;
    }
    std::vector<PresentPath> left;
    for (PresentPath& path : paths) {
        const auto found = less.find(path.path);
        if (found == less.end() || path.kind != PresentPath::Kind::kWhole) {
            left.push_back(std::move(path));
            continue;
        }
        for (const std::string& file : found->second->instead) {
            left.push_back({file, path.ordered});
        }
    }
    return left;
}

}  // namespace programs
