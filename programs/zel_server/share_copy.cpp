#include "programs/zel_server/share_copy.h"

#include <fcntl.h>
#include <syslog.h>

#include <algorithm>
#include <cerrno>
#include <ctime>
#include <filesystem>
#include <vector>

#include "ZEL/rsyncer.h"
#include "base/random_digits.h"
#include "base/text.h"
#include "base/unique_fd.h"
#include "programs/zel_server/share_module.h"

namespace zel_server {

namespace {

std::vector<std::string> Words(const Command& command, const char* key) {
    std::vector<std::string> words;
    if (const std::string* const value = command.Find(key)) {
        ZEL::SplitStringByChars(*value, " ", words);
    }
    return words;
}

// Which generations of this copy the client knows.
std::vector<uint64_t> KnownGenerations(const CopyState& copy, const Command& start) {
    std::vector<uint64_t> generations;
    for (const std::string& word : Words(start, "known")) {
        const size_t colon = word.find(':');
        const auto generation = colon == std::string::npos
                                    ? std::nullopt
                                    : base::ParseNumber(word.substr(colon + 1), UINT64_MAX);
        if (generation && word.compare(0, colon, copy.identity) == 0) {
            generations.push_back(*generation);
        }
    }
    return generations;
}

bool IsEmptyFolder(const std::string& path) {
    std::error_code error;
    return std::filesystem::is_empty(path, error) && !error;
}

// The end of the sentence "The copy of share 'x' begins anew, ..."
const char* ReasonOf(CopyFolder folder) {
    return folder == CopyFolder::kGone ? "as its folder is gone"
                                       : "as there is another folder than it had";
}

bool BeginAnew(const std::string& path, CopyState& copy) {
    const base::UniqueFd folder(open(path.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    const auto identity = folder ? base::IdentityOf(folder.Get()) : std::nullopt;
    if (!identity) {
        return false;
    }
    copy = CopyState();
    copy.identity = base::RandomDigits();
    copy.since = time(nullptr);
    copy.folder = *identity;
    return !copy.identity.empty();
}

}  // namespace

CopyFolder LookAtCopy(const CopyState& copy, const std::string& path) {
    const base::UniqueFd folder(open(path.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!folder) {
        return errno == ENOENT ? CopyFolder::kGone : CopyFolder::kUnread;
    }
    const auto now = base::IdentityOf(folder.Get());
    return !now                                                         ? CopyFolder::kUnread
           : copy.identity.empty() || IsSameIdentity(copy.folder, *now) ? CopyFolder::kSame
                                                                        : CopyFolder::kAnother;
}

CopyFound TakeCopy(const ServerConfig& config, const std::string& share, const std::string& path,
                   bool is_known, CopyState& copy) {
    const CopyFolder folder = LookAtCopy(copy, path);
    const bool has_identity = !copy.identity.empty();
    if (folder == CopyFolder::kUnread ||
        (folder == CopyFolder::kGone && !MakeShareFolder(config, path))) {
        return CopyFound::kFailed;
    }
    if (folder == CopyFolder::kSame && has_identity) {
        return CopyFound::kReady;
    }
    if (!is_known && !IsEmptyFolder(path)) {
        return CopyFound::kNobodys;
    }
    if (has_identity) {
        syslog(LOG_WARNING,
               "zel_server: the copy of share '%s' in %s begins anew, %s: its client compares all "
               "of it",
               share.c_str(), path.c_str(), ReasonOf(folder));
    }
    return BeginAnew(path, copy) ? CopyFound::kReady : CopyFound::kFailed;
}

bool HasGoneOnWithout(const CopyState& copy, const Command& start) {
    const std::vector<std::string> pushes = Words(start, "knownPushes");
    if (!copy.push.empty() && std::find(pushes.begin(), pushes.end(), copy.push) != pushes.end()) {
        return false;
    }
    const std::vector<uint64_t> known = KnownGenerations(copy, start);
    return std::any_of(known.begin(), known.end(),
                       [&](uint64_t generation) { return generation <= copy.generation; });
}

bool KnowsLater(const CopyState& copy, const Command& start) {
    const std::vector<uint64_t> known = KnownGenerations(copy, start);
    return std::any_of(known.begin(), known.end(),
                       [&](uint64_t generation) { return generation > copy.generation; });
}

std::string CopyAnswer(const CopyState& copy) {
    return "copy=\"" + copy.identity + "\"\ngeneration=\"" + std::to_string(copy.generation) +
           "\"\n";
}

}  // namespace zel_server
