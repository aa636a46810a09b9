// A push into a share's copy, as this machine notes it: whether the copy is the one that it left.
//
// docs/server-commands.md tells how a copy is known. Each push has a mark of its own, random, which
// is on this machine's disk before the server sees it: whatever breaks, the server's last mark is
// one of this machine's, unless another machine has pushed since.
#pragma once

#include <chrono>
#include <cstdint>
#include <list>
#include <optional>
#include <string>
#include <vector>

#include "programs/common/share_notes.h"
#include "tarq/rsync_wrapper.h"

namespace programs {

/// Files of this size and more are gone on with when a push breaks.
constexpr uint64_t kLargeFile = uint64_t{8} << 20;

/// Threads: one thread.
class CopyPush {
public:
    /// Notes that a push of these paths of the share ("/photos") begins. Throws Failure (kLocal)
    /// when it cannot.
    CopyPush(const std::string& share, const std::vector<std::string>& paths);

    /// Its mark.
    const std::string& Mark() const { return mark_; }

    /// What goes with the start command.
    const std::list<std::string>& Lines() const { return lines_; }

    /// What besides goes with a push that is one connection: which copy, how far, and as which push
    /// has left it. `identity`: of the server's copy, as it was told last; empty: it was not yet.
    /// Nothing when this machine cannot say that, or when there is more to find out at a start.
    std::optional<std::list<std::string>> Expected(const std::string& identity);
    /// The server has let such a push in: the copy was as expected. Whether it has noted the push's
    /// end, if there was one, the next start tells.
    void Entered();
    bool HasEntered() const { return has_entered_; }

    /// The copy that the server has; empty: it tells none, or was not asked yet.
    const std::string& Identity() const { return identity_; }

    /// The server has taken the start; `answer` is what it says of the copy, nothing for servers
    /// that know no such thing.
    void Accepted(const std::string& answer);
    /// It has refused; `gone_on`: because others have gone on with the copy.
    void Refused(const std::string& answer, bool gone_on);

    /// Whether all of the share must be compared, whatever has changed: the copy is not one that
    /// this machine has completed, or is older than this machine knows.
    bool MustCompare() const { return must_compare_; }

    /// The path ("/photos/a.mov") of a file of which the server has a part, to go on with before
    /// anything else is sent; empty: of none.
    const std::string& Resumes() const { return resumes_; }

    /// What a run of the push tells. Large files are noted, so that the server can be asked what it
    /// has of them.
    void Sends(const TARQ::Backup::RunChange& change);

    /// A run of the push was ended in the midst of a file: from now on Lines() ask, with another
    /// start, what the server has of it. False: it was in the midst of none that is worth it.
    bool AskAgain();

    /// The push has ended. `completed`: and the server has confirmed it; `whole`: all of the share
    /// was compared. What cannot be noted is known from the mark, next time.
    void Ended(bool completed, bool whole);

private:
    void SetLines();

    const std::string share_;
    std::vector<std::string> asked_;  // of which of the files that were being sent the server hears
    std::vector<std::string> sending_;             // as in ShareNotes, of this push
    std::chrono::steady_clock::time_point noted_;  // when that was noted last
    std::string resumes_;
    std::string mark_;
    std::string known_;   // what the server is told of the copies that this machine knows, ...
    std::string pushes_;  // ... and of its pushes
    std::list<std::string> lines_;
    ShareNotes before_;                  // as this machine had them
    std::optional<KnownCopy> expected_;  // of Expected()
    bool has_entered_ = false;
    std::string identity_;  // of the copy; empty: the server tells none
    uint64_t generation_ = 0;
    bool must_compare_ = false;
};

}  // namespace programs
