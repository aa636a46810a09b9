#include "programs/common/share_sender.h"

#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <iterator>
#include <list>
#include <map>
#include <optional>
#include <unordered_set>
#include <utility>

#include "programs/common/copy_reading.h"
#include "programs/common/host.h"
#include "programs/common/mounts_below.h"
#include "programs/common/open_share.h"
#include "programs/common/present_paths.h"
#include "programs/common/share_moves.h"
#include "programs/common/share_path.h"
#include "programs/common/share_start.h"
#include "programs/common/text.h"

namespace programs {

namespace {

using std::chrono::steady_clock;
using TARQ::Backup::RunCause;
using TARQ::Backup::RunChange;
using TARQ::Backup::RunOptions;
using TARQ::Backup::RunProgress;
using TARQ::Backup::RunReport;

constexpr int kNoConnection = 35;  // rsync: none came up in time
// How often a share is copied in one run when it keeps changing meanwhile.
constexpr int kBusyTries = 3;
// How many runs may be made of one because not all of it can be read.
constexpr int kMaxParts = 16;
// A server that did not take a form of deletions is asked for it again after so long.
constexpr std::chrono::hours kFormHolds(1);
// Of the names of what was moved: a start has room for 5 KiB.
constexpr size_t kMaxMovesAtOnce = 3000;
// A share of which it has not taken a push in one connection is pushed in the ordinary way for so
// long.
constexpr std::chrono::minutes kNotTakenHolds(10);

RunFailure MountAway(const std::string& share, const std::string& mount) {
    return RunFailure(FailureKind::kLocal, 0,
                      QuotedShare(share) + ": " + Printable(mount) +
                          " is not mounted, as it was before. Its part of the copy stays as it "
                          "is, and the rest is pushed. Mount it or, when it is gone for good, say "
                          "'zelctl share confirm " +
                          Printable(share) + "'",
                      Reach::kPaths);
}

/// What one run sends: folders by their entries, files by their bytes, or anything else.
struct Piece {
    std::vector<PresentPath> paths;
    int busy = 0;  // how often it changed while it was sent
};

bool IsWhole(const std::vector<PresentPath>& paths) {
    return paths.size() == 1 && paths.front().path == kWholeShare &&
           paths.front().kind == PresentPath::Kind::kWhole;
}

uint64_t FilesIn(const RunReport& of) {
    return of.files_total - std::min(of.files_total, of.folders_total);
}

// Whether these are all files, so few that nothing much can be lost: a folder's files may be.
bool AreFewFiles(const Brake& brake, const std::string& folder,
                 const std::vector<PresentPath>& paths) {
    Brake of_files = brake;
    of_files.at_most = paths.size();
    of_files.folders.clear();
    return !of_files.MustLook() &&
           std::all_of(paths.begin(), paths.end(), [&](const PresentPath& path) {
               struct stat info = {};
               return lstat((folder + path.path).c_str(), &info) == 0 && S_ISREG(info.st_mode);
           });
}

std::vector<std::string> OrderedOf(const std::vector<PresentPath>& paths) {
    std::vector<std::string> ordered;
    for (const PresentPath& path : paths) {
        ordered.insert(ordered.end(), path.ordered.begin(), path.ordered.end());
    }
    return ordered;
}

// What is new is sent before what is gone is deleted, where these are two runs: a file that was
// moved is in the copy at any time.
std::list<Piece> PiecesOf(const std::vector<PresentPath>& paths) {
    using Kind = PresentPath::Kind;
    Piece as_named;
    Piece by_entries;
    Piece by_bytes;
    for (const PresentPath& path : paths) {
        Piece& piece = path.kind == Kind::kEntries ? by_entries
                       : path.kind == Kind::kBytes ? by_bytes
                                                   : as_named;
        piece.paths.push_back(path);
    }
    std::list<Piece> pieces;
    for (Piece* const piece : {&as_named, &by_bytes, &by_entries}) {
        if (!piece->paths.empty()) {
            pieces.push_back(std::move(*piece));
        }
    }
    return pieces;
}

// Keeps in `paths` what the run complained of, and returns what has to be sent again without:
// folders, whose deletions were not made, and all else if it is not known what is missing. Of
// complaints that fit to no path, nothing is known.
std::vector<PresentPath> TakeReadable(std::vector<PresentPath>& paths, const RunReport& ran) {
    std::unordered_set<std::string> named;
    for (const std::string& entry : ran.incomplete) {
        std::string path = "/" + entry;
        while (named.insert(path).second) {
            path = FolderAbove(path);
        }
    }
    const auto failed =
        std::stable_partition(paths.begin(), paths.end(),
                              [&](const PresentPath& path) { return named.count(path.path) != 0; });
    if (failed == paths.begin()) {
        return {};
    }
    std::vector<PresentPath> again;
    std::copy_if(failed, paths.end(), std::back_inserter(again),
                 [&](const PresentPath& path) { return path.is_folder || !ran.all_incomplete; });
    paths.erase(failed, paths.end());
    return again;
}

// Nothing was deleted in this push, because of `failure`: what may be owed is added to
// `undone`.
void LeaveDeletions(const std::string& share, const std::vector<PresentPath>& paths,
                    const RunFailure& failure, std::vector<Undone>& undone) {
    std::unordered_set<std::string> known;
    for (const Undone& item : undone) {
        known.insert(item.paths.begin(), item.paths.end());
    }
    std::vector<PresentPath> owed;
    std::copy_if(paths.begin(), paths.end(), std::back_inserter(owed),
                 [&](const PresentPath& path) {
                     const bool deletes = path.is_folder || path.kind == PresentPath::Kind::kGone;
                     return deletes && known.count(path.ordered.front()) == 0;
                 });
    if (!owed.empty()) {
        undone.push_back({share, OrderedOf(owed), failure});
    }
}

/// The server does not take deletions in the form that was tried.
struct OtherFormWanted {
    Deletions form;
};

/// What all runs of one share's push have in common.
struct Work {
    const RunOrder& order;
    const ShareOrder& share;
    const OpenShare& folder;
    const std::vector<std::string> away;  // mounts below it that are not there
};

/// Where a share's push reads, held open, and what it leaves out.
struct Source {
    Source(ServerSession& session, const RunOrder& of, const ShareOrder& share)
        : facts(FactsOf(session, share.share)), folder(share.share, facts.GetModulePath()) {
        Noted([&] { away = MissingMounts(share.share, facts.GetModulePath(), of.excludes); });
        order.task_id = of.task_id;
        order.excludes = Without(away, of.excludes);
        order.bandwidth = of.bandwidth;
    }

    const ZEL::ShareInfo facts;
    const OpenShare folder;
    std::vector<std::string> away;  // mounts below it that are not there
    RunOrder order;

private:
    static ZEL::ShareInfo FactsOf(ServerSession& session, const std::string& share) {
        ZEL::ShareInfo facts;
        if (session.rsyncer.GetShareInfo(share, facts) != 0) {
            throw session.Failed(QuotedShare(share) + " cannot be looked up", 0, Reach::kShare);
        }
        return facts;
    }
};

/// What was found out before a push.
struct Look {
    bool nothing_to_do = false;
    bool keep_missing = false;      // nothing is to be deleted: whatever is missing by then, stays
    std::optional<uint64_t> files;  // that the whole share has
    std::optional<RunFailure> unread;  // the source could not be read in full
};

struct How {
    bool keep_missing;
    bool resume;
};

// What was sent of a path is not complete where a mount is away.
std::vector<Undone> BehindMounts(const Work& work, const std::vector<PresentPath>& paths) {
    std::vector<Undone> undone;
    for (const std::string& mount : work.away) {
        std::vector<PresentPath> waiting;
        std::copy_if(paths.begin(), paths.end(), std::back_inserter(waiting),
                     [&](const PresentPath& path) {
                         return IsAtOrBelow(mount, path.path) || IsAtOrBelow(path.path, mount);
                     });
        if (!waiting.empty()) {
            undone.push_back(
                {work.share.share, OrderedOf(waiting), MountAway(work.share.share, mount)});
        }
    }
    return undone;
}

}  // namespace

struct ShareSender::Impl {
    Impl(ServerSession& with, const RunListener& told) : session(with), listener(told) {}

    // What was moved need not be sent. After the brake: of what waits for a person nothing is done.
    // Told or not, they are never told after their paths were sent, which mends what they do.
    // Returns which of them the server has made.
    std::vector<bool> TellMoves(const Work& work) {
        const ShareOrder& share = work.share;
        std::optional<std::vector<bool>> made;
        const bool first = sums.moved.insert(share.share).second;
        if (first && !share.moves.empty() && knows_moves && share.brake.is_known) {
            made = SendMoves(session, share, work.folder.Path(), work.order.excludes);
            knows_moves = made.has_value();
        }
        return made.value_or(std::vector<bool>(share.moves.size(), false));
    }

    // A folder that was moved, and in which little else has changed, is at the server once that has
    // moved it, too: of it only what may have changed is sent. So nothing more is lost with it, and
    // the brake has nothing to look at, unless there is something else. Returns whether there is,
    // or may be.
    bool SendLessOfMoved(const Work& work, std::vector<PresentPath>& paths, bool may_lose) {
        const std::vector<ShareMove>& moves = work.share.moves;
        const bool is_known = std::any_of(moves.begin(), moves.end(), [](const ShareMove& move) {
            return !move.instead.empty();
        });
        const std::vector<bool> all(moves.size(), true);
        if (!is_known || !work.away.empty() ||
            (may_lose && BrakeAfter(work.share, all).MustLook())) {
            return may_lose;
        }
        const std::vector<bool> made = TellMoves(work);
        paths = PathsAfter(std::move(paths), work.share, made);
        return may_lose && BrakeAfter(work.share, made).MustLook();
    }

    // Which form of deletions the server takes is learned with the first run that has some: one in
    // a form that it does not take does nothing.
    void SendPaths(const RunOrder& order, const ShareOrder& share, bool may_lose, CopyPush& copy,
                   RunReport& sent, std::vector<Undone>& undone) {
        const Source source(session, order, share);
        const Work work = {source.order, share, source.folder, source.away};
        ForgetForms();
        for (bool taken = false; !taken;) {
            try {
                SendPresent(work, PathsToSend(source, share), may_lose, copy, sent, undone);
                taken = true;
            } catch (const OtherFormWanted& wanted) {
                Learn(wanted);
            }
        }
    }

    // A server that takes no list of changes is older than the comparison by bytes, too.
    std::vector<PresentPath> PathsToSend(const Source& source, const ShareOrder& share) const {
        std::vector<PresentPath> paths = PresentPaths(source.folder.Path(), share.paths, deletions);
        if (deletions != Deletions::kByTree) {
            for (const DoubtfulFile& file : share.doubtful) {
                paths.push_back({file.path, {file.ordered}, PresentPath::Kind::kBytes});
            }
        }
        return paths;
    }

    void ForgetForms() {
        if (steady_clock::now() >= ask_again_at) {
            deletions = Deletions::kNamed;
        }
    }
    void Learn(const OtherFormWanted& wanted) {
        deletions = wanted.form;
        ask_again_at = steady_clock::now() + kFormHolds;
    }

    bool SendAtOnce(const RunOrder& order, const ShareOrder& share, const std::string& identity,
                    bool may_lose, CopyPush& copy, RunReport& sent) {
        const auto now = steady_clock::now();
        if (order.announce || share.rest_waits || now < pushes_known_at ||
            now < ordinary_until[share.share]) {
            return false;
        }
        const auto expected = copy.Expected(identity);
        std::optional<Source> opened;
        try {
            opened.emplace(session, order, share);
        } catch (const RunFailure&) {
            return false;
        }
        const Source& source = *opened;
        std::list<std::string> lines;
        if (!expected || source.facts.IsEncrypted() || !source.away.empty() ||
            session.rsyncer.GenStartSyncShareCmd(share.share, true, lines) != 0) {
            return false;
        }
        lines.insert(lines.end(), expected->begin(), expected->end());
        const std::vector<ToldMoves> told =
            MovesToTell(share, source.folder.Path(), order.excludes, kMaxMovesAtOnce);
        std::vector<bool> moved(share.moves.size(), false);
        for (const size_t i : told.empty() ? std::vector<size_t>() : told.front().moves) {
            moved[i] = true;
        }
        if (!told.empty()) {
            lines.push_back("moves=\"" + told.front().paths + "\"");
        }
        ForgetForms();
        const auto paths = PathsAfter(PathsToSend(source, share), share, moved);
        const Brake brake = BrakeAfter(share, moved);
        if (told.size() > 1 || PiecesOf(paths).size() != 1 || IsWhole(paths) ||
            (may_lose && brake.MustLook() && !AreFewFiles(brake, source.folder.Path(), paths))) {
            return false;
        }
        const Work work = {source.order, share, source.folder, source.away};
        const Bandwidth bandwidth = BandwidthOf(work);
        RunOptions wishes;
        CopyChanges& made = sums.copies[share.share];
        wishes.start = std::move(lines);
        wishes.on_change = [&](const RunChange& change) {
            made.Add(change);
            copy.Sends(change);
        };
        wishes.bandwidth_limit = bandwidth.Now();
        int status = 0;
        int ran = 0;
        try {
            ran = RunPiece(
                work, paths, wishes,
                [&, limit = wishes.bandwidth_limit] { return bandwidth.Now() != limit; }, status);
        } catch (const OtherFormWanted& wanted) {
            Learn(wanted);
            return false;
        }
        const RunReport& report = session.report;
        if (report.cause == RunCause::UNKNOWN_MODULE) {
            pushes_known_at = now + kFormHolds;
            return false;
        }
        if (report.cause == RunCause::NOT_STARTED) {
            if (told.empty()) {  // else it may be for what cannot be moved there
                ordinary_until[share.share] = now + kNotTakenHolds;
            }
            return false;
        }
        if (report.begun) {
            copy.Entered();
        }
        ThrowIfAway(share.share, status);
        ++sums.rsync_runs;
        AddChanges(sent, report);
        AddTraffic(sent, report);
        // report.status is that of no run when the folder has gone meanwhile.
        if (ran != 0 || status != 0 || report.status != 0) {
            copy.AskAgain();
            return false;
        }
        AddFiles(sent, report);
        sums.moved.insert(share.share);
        return true;
    }

    // An ordinary start would come to the same, and take as long.
    void ThrowIfAway(const std::string& share, int status) const {
        const bool is_away = status == TARQ::Backup::STATUS_SOCKET || status == kNoConnection ||
                             status == TARQ::Backup::STATUS_AUTHENTICATION;
        if (session.cancel || session.Silent() || is_away) {
            throw session.Failed(session.report.begun
                                     ? QuotedShare(share) + " is not complete"
                                     : "the server does not take " + QuotedShare(share),
                                 status, ReachOfCommand(status));
        }
    }

    Bandwidth BandwidthOf(const Work& work) const {
        return work.order.bandwidth.value_or(Bandwidth(session.info.GetMaxBandwidth()));
    }

    void SendPresent(const Work& work, std::vector<PresentPath> paths, bool may_lose,
                     CopyPush& copy, RunReport& sent, std::vector<Undone>& undone) {
        std::vector<Undone> failed = BehindMounts(work, paths);
        const auto is_away = [&](const PresentPath& path) {
            return std::any_of(work.away.begin(), work.away.end(), [&](const std::string& mount) {
                return IsAtOrBelow(path.path, mount);
            });
        };
        paths.erase(std::remove_if(paths.begin(), paths.end(), is_away), paths.end());
        const bool whole = IsWhole(paths);
        Look seen;
        may_lose = SendLessOfMoved(work, paths, may_lose);
        if (may_lose && !AreFewFiles(work.share.brake, work.folder.Path(), paths)) {
            seen = LookAhead(work, paths, sent);
        }
        if (!seen.nothing_to_do) {
            TellMoves(work);
        }
        CopyChanges& made = sums.copies[work.share.share];
        const auto send = [&](const std::vector<PresentPath>& piece, bool resume) {
            SendPiece(work, piece, {seen.keep_missing, resume}, copy, sent, made);
        };
        if (!seen.nothing_to_do) {
            // What the server has of a file goes first and alone: all else is sent as ever.
            if (!copy.Resumes().empty()) {
                for (const PresentPath& path : PresentPaths(work.folder.Path(), {copy.Resumes()})) {
                    if (path.path == copy.Resumes() && !is_away(path)) {
                        Resume([&] { send({path}, true); });
                    }
                }
            }
            SendInParts(work.share.share, PiecesOf(paths), send, failed);
        }
        if (seen.unread) {
            LeaveDeletions(work.share.share, paths, *seen.unread, failed);
        }
        if (failed.empty() && whole) {
            made.files = seen.files ? *seen.files : FilesIn(session.report);
        }
        std::move(failed.begin(), failed.end(), std::back_inserter(undone));
    }

    // Where some of a piece cannot be read the rest is sent once more without it, since rsync
    // deletes nothing in a folder then; what only changed meanwhile is tried again by itself.
    template <typename Send>
    void SendInParts(const std::string& share, std::list<Piece> pieces, const Send& send,
                     std::vector<Undone>& undone) {
        for (int run = 1; !pieces.empty(); ++run) {
            Piece piece = std::move(pieces.front());
            pieces.pop_front();
            try {
                send(piece.paths, false);
            } catch (const RunFailure& failure) {
                if (failure.reach == Reach::kPaths && run < kMaxParts) {
                    Piece rest = {TakeReadable(piece.paths, session.report)};
                    if (!rest.paths.empty()) {
                        pieces.push_front(std::move(rest));
                    }
                    if (session.report.cause == RunCause::BUSY_SOURCE &&
                        ++piece.busy < kBusyTries) {
                        pieces.push_front(std::move(piece));
                        continue;
                    }
                }
                undone.push_back({share, OrderedOf(piece.paths), failure});
                if (failure.reach != Reach::kPaths) {
                    for (const Piece& left : pieces) {
                        const std::vector<std::string> ordered = OrderedOf(left.paths);
                        std::vector<std::string>& all = undone.back().paths;
                        all.insert(all.end(), ordered.begin(), ordered.end());
                    }
                    return;
                }
            }
        }
    }

    // A push never hangs on it: if the server cannot go on with what it has, or something is wrong
    // with the file, that file is sent with the rest.
    template <typename Step>
    void Resume(Step step) {
        try {
            step();
        } catch (const RunFailure& failure) {
            const bool is_broken = session.report.status == TARQ::Backup::STATUS_SOCKET ||
                                   session.report.status == TARQ::Backup::STATUS_PROTOCOL_STREAM ||
                                   session.report.status == kNoConnection || session.Silent();
            if (session.cancel || is_broken) {
                throw;
            }
        }
    }

    // Finds out what a push would lose, and asks a person when that is too much. What is found goes
    // by names, sizes and times alone, as the push itself does.
    Look LookAhead(const Work& work, const std::vector<PresentPath>& paths, RunReport& sent) {
        const ShareOrder& share = work.share;
        LossCount losses(share.brake, work.folder.Path());
        Look seen;
        bool complete = true;
        for (const Piece& piece : PiecesOf(paths)) {
            RunOptions wishes;
            wishes.dry_run = true;
            wishes.on_change = [&](const RunChange& change) { losses.Add(change); };
            int status = 0;
            const int ran = RunPiece(work, piece.paths, std::move(wishes), nullptr, status);
            const bool part = session.report.cause == RunCause::BUSY_SOURCE ||
                              session.report.cause == RunCause::UNREADABLE_SOURCE;
            if (ran != 0 || session.cancel || (status != 0 && status != kVanishedFiles && !part)) {
                throw session.Failed(QuotedShare(share.share) + " cannot be compared", status,
                                     Reach::kShare);
            }
            if (part) {
                seen.unread = Incomplete(share.share, piece.paths, status);
            }
            // A folder that has gone meanwhile is the push's to judge.
            complete = complete && !part && session.report.status >= 0;
        }
        const bool whole = IsWhole(paths);
        // A source that could not be read in full had no deletions counted: there are to be none.
        seen.keep_missing = !complete || losses.Deleted() == 0;
        seen.nothing_to_do = complete && losses.FindsNothing();
        if (whole) {
            seen.files = FilesIn(session.report);
        }
        const uint64_t in_copy =
            whole ? losses.FilesOfCopy(*seen.files) : share.brake.files.value_or(0);
        if (seen.nothing_to_do) {
            AddFiles(sent, session.report);
            AddTraffic(sent, session.report);
        }
        if (losses.IsTooMuch(in_copy) && !losses.IsAllowed(share.consent)) {
            ListCopy(session, share.share, [&](const RunChange& file) { losses.AddOfCopy(file); });
            if (losses.IsTooMuch(in_copy) && !losses.IsAllowed(share.consent)) {
                throw RunFailure(losses.ToQuestion(share.share, in_copy));
            }
        }
        return seen;
    }

    // One run of rsync for all of `paths`.
    int RunPiece(const Work& work, const std::vector<PresentPath>& paths, RunOptions wishes,
                 std::function<bool()> interrupted, int& status) {
        using Kind = PresentPath::Kind;
        wishes.source_folder = work.folder.Fd();
        wishes.keep_versions = true;  // in a dry run, their folder at the server is no difference
        if (!IsWhole(paths)) {
            wishes.shallow = paths.front().kind == Kind::kEntries;
            wishes.by_content = paths.front().kind == Kind::kBytes;
            wishes.changes.reserve(paths.size());
            for (const PresentPath& path : paths) {
                wishes.changes.push_back(path.path.substr(1));
                wishes.deletes_changes = wishes.deletes_changes || path.kind == Kind::kGone;
            }
        }
        if (listener.on_progress) {
            wishes.on_progress = [this, share = work.share.share](const RunProgress& progress) {
                listener.on_progress(share, progress);
            };
        }
        ZEL::Rsyncer& rsync = session.With(std::move(wishes));
        session.interrupt = std::move(interrupted);
        const int ran = rsync.RunSync(work.order.task_id, work.share.share, kWholeShare,
                                      ToList(work.order.excludes), status);
        if (session.report.cause == RunCause::NO_NAMED_DELETIONS &&
            deletions == Deletions::kNamed) {
            throw OtherFormWanted{Deletions::kByEntries};
        }
        if (session.report.cause == RunCause::NO_LISTED_CHANGES &&
            deletions != Deletions::kByTree) {
            throw OtherFormWanted{Deletions::kByTree};
        }
        return ran;
    }

    void SendPiece(const Work& work, const std::vector<PresentPath>& paths, const How& how,
                   CopyPush& copy, RunReport& sent, CopyChanges& made) {
        const std::string& share = work.share.share;
        const Bandwidth bandwidth = BandwidthOf(work);
        int status = 0;
        int ran = 0;
        bool is_other = false;
        bool was_ended = false;
        do {
            RunOptions wishes;
            wishes.keep_missing = how.keep_missing;
            wishes.on_change = [&](const RunChange& change) {
                made.Add(change);
                copy.Sends(change);
            };
            wishes.bandwidth_limit = bandwidth.Now();
            wishes.resume = how.resume && copy.Resumes() == paths.front().path;
            is_other = false;
            ran = RunPiece(
                work, paths, wishes,
                [&, limit = wishes.bandwidth_limit] {
                    is_other = is_other || bandwidth.Now() != limit;
                    return is_other;
                },
                status);
            if (ran == 0 && status == 0 && session.report.status < 0) {
                throw RunFailure(FailureKind::kLocal, 0,
                                 QuotedShare(share) + ": its folder is gone", Reach::kShare);
            }
            ++sums.rsync_runs;
            AddChanges(sent, session.report);
            if (!how.resume) {  // the rest counts that file, too
                AddFiles(sent, session.report);
            }
            AddTraffic(sent, session.report);
            // rsync cannot change its rate: another one goes on with the new limit.
            was_ended = is_other && session.report.status == TARQ::Backup::STATUS_CANCELLED &&
                        !session.cancel;
            if (was_ended && copy.AskAgain()) {
                StartShare(session, share, copy, listener.on_paired);
                if (!how.resume) {
                    ResumeOneOf(work, paths, how, copy, sent, made);
                }
            }
        } while (was_ended);
        // Files that vanish during the copy will be reported as changes as well.
        if (ran != 0 || (status != 0 && status != kVanishedFiles)) {
            throw Incomplete(share, paths, status);
        }
    }

    // A run that was ended has left a part of a file at the server: it goes on with that first.
    void ResumeOneOf(const Work& work, const std::vector<PresentPath>& paths, const How& how,
                     CopyPush& copy, RunReport& sent, CopyChanges& made) {
        const std::string& file = copy.Resumes();
        const bool is_sent =
            !file.empty() &&
            std::any_of(paths.begin(), paths.end(), [&file](const PresentPath& path) {
                return path.kind == PresentPath::Kind::kWhole && IsAtOrBelow(file, path.path);
            });
        if (is_sent) {
            Resume([&] {
                SendPiece(work, {{file, {file}}}, {how.keep_missing, true}, copy, sent, made);
            });
        }
    }

    // The failure of the last run, which sent `paths`.
    RunFailure Incomplete(const std::string& share, const std::vector<PresentPath>& paths,
                          int status) const {
        const bool busy = session.report.cause == RunCause::BUSY_SOURCE;
        const bool part = busy || session.report.cause == RunCause::UNREADABLE_SOURCE;
        const bool one = paths.size() == 1 && !IsWhole(paths);
        RunFailure failed =
            session.Failed(QuotedShare(share) + (one ? ": " + Printable(paths.front().path) : "") +
                               " is not complete",
                           status, part ? Reach::kPaths : Reach::kShare);
        return busy && failed.Kind() == FailureKind::kFailed
                   ? RunFailure(FailureKind::kBusy, status, failed.what(), failed.reach,
                                failed.details)
                   : failed;
    }

    ServerSession& session;
    const RunListener& listener;
    Sums sums;
    bool knows_moves = true;                   // false: the server has said otherwise
    Deletions deletions = Deletions::kNamed;   // the form that the server takes
    steady_clock::time_point ask_again_at;     // the server may be a newer one by then
    steady_clock::time_point pushes_known_at;  // before that it takes none in one connection
    std::map<std::string, steady_clock::time_point> ordinary_until;  // the same, by share
};

ShareSender::ShareSender(ServerSession& session, const RunListener& listener)
    : impl_(std::make_unique<Impl>(session, listener)) {}

ShareSender::~ShareSender() = default;

bool ShareSender::SendAtOnce(const RunOrder& order, const ShareOrder& share,
                             const std::string& identity, bool may_lose, CopyPush& copy,
                             RunReport& sent) {
    return impl_->SendAtOnce(order, share, identity, may_lose, copy, sent);
}

void ShareSender::Send(const RunOrder& order, const ShareOrder& share, bool may_lose,
                       CopyPush& copy, RunReport& sent, std::vector<Undone>& undone) {
    impl_->SendPaths(order, share, may_lose, copy, sent, undone);
}

ShareSender::Sums ShareSender::TakeSums() {
    return std::exchange(impl_->sums, {});
}

uint64_t ShareSender::RsyncRuns() const {
    return impl_->sums.rsync_runs;
}

}  // namespace programs
