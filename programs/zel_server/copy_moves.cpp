#include "programs/zel_server/copy_moves.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <string_view>

#include "ZEL/rsyncer.h"
#include "base/open_beneath.h"
#include "base/percent.h"
#include "base/replace_file.h"
#include "base/text.h"
#include "base/unique_fd.h"
#include "base/whole_file.h"
#include "programs/common/share_path.h"
#include "programs/zel_server/file_tree.h"

namespace zel_server {

namespace {

using base::UniqueFd;
using Pair = std::pair<std::string, std::string>;

constexpr char kMoves[] = "/moves";
constexpr char kMoving[] = "/moving";
constexpr char kLineEnd[] = ".";  // a line without it was cut by a crash
constexpr char kPlain[] = "/.-_";
// So many moves, some 200,000, are kept of a share. With more, files are sent instead.
constexpr off_t kMaxMoves = off_t{16} << 20;
constexpr int kFolderFlags = O_RDONLY | O_DIRECTORY;

bool Touches(const std::string& one, const std::string& other) {
    return IsAtOrBelow(one, other) || IsAtOrBelow(other, one);
}

// ---- Lines ----

/// A move, and what the entry is known by wherever it is.
struct BegunMove {
    RecordedMove move;
    std::string entry;  // "INODE BIRTH"
};

std::string LineOf(const RecordedMove& move, const std::string& entry = "") {
    return TimeText(move.time) + " " + base::PercentEncoded(move.from, kPlain) + " " +
           base::PercentEncoded(move.to, kPlain) + " " + (entry.empty() ? "" : entry + " ") +
           kLineEnd + "\n";
}

// Lines of so many words behind the paths; others were cut.
std::vector<BegunMove> ParseLines(const std::string& text, size_t words_behind) {
    std::vector<BegunMove> moves;
    for (size_t begin = 0; begin < text.size();) {
        const size_t end = std::min(text.find('\n', begin), text.size());
        std::vector<std::string> words;
        ZEL::SplitStringByChars(text.substr(begin, end - begin), " ", words);
        begin = end + 1;
        if (words.size() != 4 + words_behind || words.back() != kLineEnd) {
            continue;
        }
        const auto time = ParseTimeText(words[0]);
        const auto from = base::PercentDecoded(words[1]);
        const auto to = base::PercentDecoded(words[2]);
        if (time && from && to && programs::IsMovableInShare(*from) &&
            programs::IsMovableInShare(*to)) {
            BegunMove begun = {{*time, *from, *to}, ""};
            for (size_t i = 0; i < words_behind; ++i) {
                begun.entry += (i == 0 ? "" : " ") + words[3 + i];
            }
            moves.push_back(std::move(begun));
        }
    }
    return moves;
}

std::optional<std::vector<BegunMove>> ReadLines(const std::string& file, size_t words_behind) {
    const auto text = base::ReadFile(file);
    if (!text && errno != ENOENT) {
        return std::nullopt;
    }
    return ParseLines(text.value_or(""), words_behind);
}

std::optional<std::vector<BegunMove>> ReadMoving(const std::string& folder) {
    return ReadLines(folder + kMoving, 2);
}

std::optional<std::vector<RecordedMove>> ReadMoves(const std::string& folder) {
    const auto lines = ReadLines(folder + kMoves, 0);
    if (!lines) {
        return std::nullopt;
    }
    std::vector<RecordedMove> moves;
    moves.reserve(lines->size());
    for (const BegunMove& line : *lines) {
        moves.push_back(line.move);
    }
    return moves;
}

// Adds lines to the end of the list, on the disk.
bool Append(const std::string& folder, const std::string& lines) {
    const UniqueFd file(open((folder + kMoves).c_str(),
                             O_RDWR | O_CREAT | O_APPEND | O_NOFOLLOW | O_CLOEXEC, 0600));
    struct stat info = {};
    if (!file || fstat(file.Get(), &info) != 0) {
        return false;
    }
    char last = '\n';
    if (info.st_size > 0 && pread(file.Get(), &last, 1, info.st_size - 1) != 1) {
        return false;
    }
    return base::WriteAll(file.Get(), (last == '\n' ? "" : "\n") + lines) &&
           fdatasync(file.Get()) == 0;
}

// ---- Moves ----

// What the entry of the open folder is known by; nothing, with errno set, when there is none.
std::optional<std::string> Known(int folder, const std::string& name) {
    struct statx facts = {};
    if (statx(folder, name.c_str(), AT_SYMLINK_NOFOLLOW, STATX_INO | STATX_BTIME, &facts) != 0) {
        return std::nullopt;
    }
    const VersionTime born = {facts.stx_btime.tv_sec,
                              static_cast<int32_t>(facts.stx_btime.tv_nsec)};
    return std::to_string(facts.stx_ino) + " " + TimeText(born);
}

/// A move whose ends are held open.
struct OpenMove {
    BegunMove begun;
    size_t place = 0;  // in the order
    UniqueFd from;     // the folders
    UniqueFd to;
    bool made = false;
};

// The folder, and those above it, made where there is nothing.
UniqueFd HaveFolders(const UniqueFd& top, const std::string& path) {
    UniqueFd folder = base::OpenBeneath(top.Get(), path, kFolderFlags);
    if (folder || errno != ENOENT) {
        return folder;
    }
    const UniqueFd above = HaveFolders(top, PathAbove(path));
    return above ? HaveFolder(above.Get(), LastName(path)) : UniqueFd();
}

bool IsFree(int folder, const std::string& name) {
    struct stat info = {};
    return fstatat(folder, name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0 && errno == ENOENT;
}

// Nothing for a move that cannot be made.
std::optional<OpenMove> Open(const UniqueFd& top, const Pair& pair, size_t place) {
    OpenMove move;
    move.place = place;
    move.begun.move.from = pair.first;
    move.begun.move.to = pair.second;
    move.from = base::OpenBeneath(top.Get(), PathAbove(pair.first), kFolderFlags);
    auto entry = move.from ? Known(move.from.Get(), LastName(pair.first)) : std::nullopt;
    if (!entry || IsAtOrBelow(pair.second, pair.first)) {
        return std::nullopt;
    }
    move.begun.entry = *std::move(entry);
    move.to = HaveFolders(top, PathAbove(pair.second));
    return move.to && IsFree(move.to.Get(), LastName(pair.second)) ? std::optional(std::move(move))
                                                                   : std::nullopt;
}

// Makes moves of which none touches what another one has to do with.
void MakeTogether(const std::string& folder, std::vector<OpenMove>& moves,
                  std::vector<bool>& made) {
    const VersionTime now = VersionTime::Now();
    std::string begun;
    for (OpenMove& move : moves) {
        move.begun.move.time = now;
        begun += LineOf(move.begun.move, move.begun.entry);
    }
    if (moves.empty() || !base::ReplaceFile(folder + kMoving, begun, 0600)) {
        return;
    }
    std::string done;
    bool on_disk = true;
    for (OpenMove& move : moves) {
        const RecordedMove& names = move.begun.move;
        move.made = renameat2(move.from.Get(), LastName(names.from).c_str(), move.to.Get(),
                              LastName(names.to).c_str(), RENAME_NOREPLACE) == 0;
        if (move.made) {
            made[move.place] = true;
            done += LineOf(names);
        }
    }
    for (const OpenMove& move : moves) {
        on_disk =
            on_disk && (!move.made || (fsync(move.from.Get()) == 0 && fsync(move.to.Get()) == 0));
    }
    if (on_disk && (done.empty() || Append(folder, done))) {
        unlink((folder + kMoving).c_str());
    }
}

bool IsRoomFor(const std::string& folder) {
    struct stat info = {};
    return stat((folder + kMoves).c_str(), &info) == 0 ? info.st_size < kMaxMoves : errno == ENOENT;
}

}  // namespace

std::optional<std::vector<RecordedMove>> ListMoves(const std::string& folder) {
    if (access((folder + kMoving).c_str(), F_OK) == 0) {
        errno = EBUSY;
        return std::nullopt;
    }
    return ReadMoves(folder);
}

std::vector<bool> MakeMoves(const std::string& share, const std::string& copy,
                            const std::vector<Pair>& moves) {
    std::vector<bool> made(moves.size(), false);
    const std::string folder = VersionsOf(share, copy);
    const UniqueFd top = OpenFolder(AT_FDCWD, copy);
    // A past time is being read, or versions are thinned by the names that there are.
    if (!top || !HaveVersions(share, copy) || !SettleMoves(share, copy) || !IsRoomFor(folder)) {
        return made;
    }
    const VersionsLock lock(folder, LOCK_EX | LOCK_NB);
    for (size_t next = 0; lock && next < moves.size();) {
        std::vector<OpenMove> together;
        const size_t first = next;
        const auto meets = [&](const Pair& pair) {
            return std::any_of(&moves[first], &moves[next], [&](const Pair& other) {
                return Touches(pair.first, other.first) || Touches(pair.first, other.second) ||
                       Touches(pair.second, other.first) || Touches(pair.second, other.second);
            });
        };
        for (; next < moves.size() && !meets(moves[next]); ++next) {
            if (auto move = Open(top, moves[next], next)) {
                together.push_back(*std::move(move));
            }
        }
        MakeTogether(folder, together, made);
        if (!SettleMoves(share, copy)) {
            break;
        }
    }
    return made;
}

bool SettleMoves(const std::string& share, const std::string& copy) {
    const std::string folder = VersionsOf(share, copy);
    if (access((folder + kMoving).c_str(), F_OK) != 0) {
        return errno == ENOENT || errno == ENOTDIR;
    }
    const auto begun = ReadMoving(folder);
    const auto recorded = ReadMoves(folder);
    const UniqueFd top = OpenFolder(AT_FDCWD, copy);
    if (!begun || !recorded || (!top && errno != ENOENT)) {
        return false;
    }
    std::string done;
    for (const BegunMove& move : *begun) {
        const bool is_known =
            std::any_of(recorded->begin(), recorded->end(), [&](const RecordedMove& known) {
                return known.time == move.move.time && known.from == move.move.from;
            });
        const UniqueFd above =
            top ? base::OpenBeneath(top.Get(), PathAbove(move.move.to), kFolderFlags) : UniqueFd();
        if (is_known || !above || Known(above.Get(), LastName(move.move.to)) != move.entry) {
            continue;
        }
        const UniqueFd left = base::OpenBeneath(top.Get(), PathAbove(move.move.from), kFolderFlags);
        if (fsync(above.Get()) != 0 || (left && fsync(left.Get()) != 0)) {
            return false;
        }
        done += LineOf(move.move);
    }
    return (done.empty() || Append(folder, done)) && unlink((folder + kMoving).c_str()) == 0;
}

bool ForgetMoves(const std::string& folder, const VersionTime& before) {
    const auto moves = ListMoves(folder);
    if (!moves) {
        return false;
    }
    if (moves->empty() || !(moves->front().time < before)) {
        return true;
    }
    std::string kept;
    for (const RecordedMove& move : *moves) {
        kept += move.time < before ? "" : LineOf(move);
    }
    return base::ReplaceFile(folder + kMoves, kept, 0600);
}

NamesOverTime::NamesOverTime(const std::vector<RecordedMove>& moves, const VersionTime& since)
    : moves_(moves) {
    while (next_ < moves_.size() && !(since < moves_[next_].time)) {
        ++next_;
    }
}

const MovedNames& NamesOverTime::Until(const VersionTime& until) {
    for (; next_ < moves_.size() && moves_[next_].time < until; ++next_) {
        names_.Move(moves_[next_].from, moves_[next_].to);
    }
    return names_;
}

const MovedNames& NamesOverTime::UntilNow() {
    for (; next_ < moves_.size(); ++next_) {
        names_.Move(moves_[next_].from, moves_[next_].to);
    }
    return names_;
}

}  // namespace zel_server
