#include "programs/zel_server/version_retention.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "ZEL/rsyncer.h"
#include "base/folder_names.h"
#include "base/open_beneath.h"
#include "base/text.h"
#include "base/unique_fd.h"
#include "programs/zel_server/copy_moves.h"
#include "programs/zel_server/file_tree.h"
#include "programs/zel_server/server_config.h"
#include "tarq/owners.h"

namespace zel_server {

namespace {

constexpr char kSection[] = "versions";  // of server.conf
constexpr char kKeepKey[] = "keep";
constexpr char kAtLeastKey[] = "keep_at_least";
constexpr char kReserveKey[] = "reserve";
constexpr uint64_t kWeekDays = 7;
constexpr uint64_t kYearDays = 365;
constexpr uint64_t kMaxDays = 100 * kYearDays;
// What expires has such a name until its last file is gone. ListVersions() leaves it out.
constexpr char kExpired[] = "expired-";

struct Entry {
    std::string name;
    struct stat info = {};
};

std::vector<Entry> EntriesOf(int folder) {
    std::vector<Entry> entries;
    const auto names = base::NamesIn(folder);
    for (const std::string& name : names.value_or(std::vector<std::string>())) {
        Entry entry;
        entry.name = name;
        if (fstatat(folder, name.c_str(), &entry.info, AT_SYMLINK_NOFOLLOW) == 0) {
            entries.push_back(std::move(entry));
        }
    }
    return entries;
}

// Moves all entries of the folder `from` into the folder `to`, where they take the place of what
// has their names: that is younger. A folder that is not there moves as a whole.
bool MergeInto(int from, int to) {
    bool all = true;
    for (const Entry& entry : EntriesOf(from)) {
        struct stat there = {};
        const bool exists = fstatat(to, entry.name.c_str(), &there, AT_SYMLINK_NOFOLLOW) == 0;
        if (exists && S_ISDIR(entry.info.st_mode) && S_ISDIR(there.st_mode)) {
            const base::UniqueFd older = OpenFolder(from, entry.name);
            const base::UniqueFd younger = OpenFolder(to, entry.name);
            all = older && younger && MergeInto(older.Get(), younger.Get()) &&
                  unlinkat(from, entry.name.c_str(), AT_REMOVEDIR) == 0 && all;
            continue;
        }
        // Where one is a folder and the other is not, rename() refuses to replace it.
        const bool free = !exists || (!S_ISDIR(entry.info.st_mode) && !S_ISDIR(there.st_mode)) ||
                          RemoveTree(to, entry.name);
        all = free && renameat(from, entry.name.c_str(), to, entry.name.c_str()) == 0 && all;
    }
    return all;
}

/// Moves a folder of versions into a later one across moves of names: each file goes to the path
/// that it had by then, where it takes the place of a younger one.
class RenamedMerge {
public:
    /// `names`: how what was in the older one was called by the time of the younger.
    RenamedMerge(int to, const MovedNames& names) : to_(to), names_(names) {}

    /// False when something has failed. What has no place in the younger one stays: something else
    /// was moved there, or is a folder where this is a file, of which a part may have come by a
    /// move.
    bool Merge(int from, const std::string& path = "") {
        bool all = true;
        for (const Entry& entry : EntriesOf(from)) {
            const std::string old = Below(path, entry.name);
            if (S_ISDIR(entry.info.st_mode)) {
                const base::UniqueFd folder = OpenFolder(from, entry.name);
                all = folder && Merge(folder.Get(), old) &&
                      (unlinkat(from, entry.name.c_str(), AT_REMOVEDIR) == 0 || IsFull()) && all;
            } else if (const auto now = names_.Now(old)) {
                const base::UniqueFd folder = HaveFolderFor(PathAbove(*now), from);
                const bool moved = folder && renameat(from, entry.name.c_str(), folder.Get(),
                                                      LastName(*now).c_str()) == 0;
                all = (moved || errno == EISDIR || errno == ENOTDIR || errno == ELOOP) && all;
            }
        }
        return all;
    }

    /// Whether errno says that a folder could not be removed for what is in it.
    static bool IsFull() { return errno == ENOTEMPTY || errno == EEXIST; }

private:
    // The folder, made like `model` where there is none.
    base::UniqueFd HaveFolderFor(const std::string& path, int model) {
        base::UniqueFd folder = base::OpenBeneath(to_, path, O_RDONLY | O_DIRECTORY);
        if (folder || errno != ENOENT) {
            return folder;
        }
        const base::UniqueFd above = HaveFolderFor(PathAbove(path), model);
        struct stat info = {};
        folder = above && fstat(model, &info) == 0 ? HaveFolder(above.Get(), LastName(path))
                                                   : base::UniqueFd();
        return folder && CopyUserAttributes(model, folder.Get()) &&
                       fchmod(folder.Get(), info.st_mode & 07777) == 0
                   ? std::move(folder)
                   : base::UniqueFd();
    }

    int to_;
    const MovedNames& names_;
};

std::string NameOf(const VersionFolder& version) {
    return VersionName(version.time, version.id);
}

bool Expire(int all, const std::string& name) {
    return renameat(all, name.c_str(), all, (kExpired + name).c_str()) == 0;
}

bool RemoveExpired(int all) {
    bool done = true;
    for (const std::string& name : base::NamesIn(all).value_or(std::vector<std::string>())) {
        if (name.compare(0, strlen(kExpired), kExpired) == 0) {
            done = RemoveTree(all, name) && done;
        }
    }
    return done;
}

// ---- The plan ----

// The days or weeks since the epoch are what one version is kept of; nothing for a version that is
// kept for itself.
std::optional<std::pair<uint64_t, int64_t>> PeriodOf(const VersionFolder& version,
                                                     const Retention& retention, int64_t now) {
    const int64_t age = now - version.time.seconds;
    const int64_t day = version.time.seconds / kDaySeconds;
    if (age <= static_cast<int64_t>(retention.all) * kDaySeconds) {
        return std::nullopt;
    }
    const uint64_t days =
        age <= static_cast<int64_t>(retention.daily) * kDaySeconds ? 1 : kWeekDays;
    return std::pair(days, day / static_cast<int64_t>(days));
}

}  // namespace

std::optional<uint64_t> ParseAge(std::string_view text) {
    const char unit = text.empty() ? ' ' : text.back();
    const uint64_t factor = unit == 'd' ? 1 : unit == 'w' ? kWeekDays : unit == 'y' ? kYearDays : 0;
    if (factor == 0 || text.size() < 2) {
        return std::nullopt;
    }
    const auto number = base::ParseNumber(text.substr(0, text.size() - 1), kMaxDays);
    return number && *number * factor <= kMaxDays ? std::optional(*number * factor) : std::nullopt;
}

std::optional<Retention> ParseRetention(const std::string& text) {
    Retention retention;
    std::vector<std::string> rules;
    ZEL::SplitStringByChars(text, ",", rules);
    if (rules.empty()) {
        return std::nullopt;
    }
    for (const std::string& rule : rules) {
        const size_t equals = std::min(rule.find('='), rule.size());
        const std::string key = rule.substr(0, equals);
        uint64_t* const days = key == "all"      ? &retention.all
                               : key == "daily"  ? &retention.daily
                               : key == "weekly" ? &retention.weekly
                                                 : nullptr;
        const auto age = ParseAge(std::string_view(rule).substr(std::min(equals + 1, rule.size())));
        if (days == nullptr || !age) {
            return std::nullopt;
        }
        *days = *age;
    }
    return retention.all <= retention.daily && retention.daily <= retention.weekly
               ? std::optional<Retention>(retention)
               : std::nullopt;
}

std::string RetentionText(const Retention& retention) {
    return "all=" + std::to_string(retention.all) + "d,daily=" + std::to_string(retention.daily) +
           "d,weekly=" + std::to_string(retention.weekly) + "d";
}

std::optional<KeepSettings> ReadKeepSettings() {
    const TARQ::HashOwner values(KAPICSzHashAlloc(4));
    if (!values || KAPICFileGetSection(ConfigFile().c_str(), kSection, values.get()) < 0) {
        return std::nullopt;
    }
    const auto value = [&values](const char* key) {
        return KAPICSzHashGetValue(values.get(), key);
    };
    KeepSettings settings;
    if (const char* const text = value(kKeepKey)) {
        const auto retention = ParseRetention(text);
        if (!retention) {
            return std::nullopt;
        }
        settings.retention = *retention;
    }
    if (const char* const text = value(kAtLeastKey)) {
        const auto age = ParseAge(text);
        if (!age) {
            return std::nullopt;
        }
        settings.at_least = *age;
    }
    if (const char* const text = value(kReserveKey)) {
        const auto percent = base::ParseNumber(text, kMaxReserve);
        if (!percent) {
            return std::nullopt;
        }
        settings.reserve = *percent;
    }
    return settings;
}

bool WriteKeepSettings(const KeepSettings& settings) {
    const TARQ::HashOwner values =
        TARQ::MakeHash({{kKeepKey, RetentionText(settings.retention)},
                        {kAtLeastKey, std::to_string(settings.at_least) + "d"},
                        {kReserveKey, std::to_string(settings.reserve)}});
    return values &&
           KAPICFileSetSection(ConfigFile().c_str(), kSection, 0, values.get(), nullptr) > 0;
}

int64_t AgesFrom(const std::vector<VersionFolder>& versions, const VersionTime& now) {
    return versions.empty() ? now.seconds : std::min(now.seconds, versions.back().time.seconds);
}

Thinning PlanThinning(const std::vector<VersionFolder>& versions, const Retention& retention,
                      const VersionTime& now) {
    Thinning plan;
    if (versions.empty()) {
        return plan;
    }
    const int64_t today = AgesFrom(versions, now);
    // From the newest on, so that each is moved once.
    size_t last = versions.size();  // the last folder of a period, into which the others go
    for (size_t i = versions.size(); i-- > 0;) {
        const int64_t age = today - versions[i].time.seconds;
        if (age > static_cast<int64_t>(retention.weekly) * kDaySeconds) {
            plan.expired.push_back(i);
            continue;
        }
        const auto period = PeriodOf(versions[i], retention, today);
        if (period && last < versions.size() &&
            PeriodOf(versions[last], retention, today) == period) {
            plan.merged.emplace_back(i, last);
        } else {
            last = i;
        }
    }
    std::reverse(plan.expired.begin(), plan.expired.end());  // the oldest first
    return plan;
}

namespace {

// Merges the older one, which goes unless something in it has no place in the younger. False, with
// errno set, when that failed.
bool Merge(int all, const VersionFolder& older, const VersionFolder& younger,
           const std::vector<RecordedMove>& moves) {
    const std::string name = NameOf(older);
    const base::UniqueFd from = OpenFolder(all, name);
    const base::UniqueFd to = OpenFolder(all, NameOf(younger));
    if (!from || !to) {
        return false;
    }
    const bool was_moved = std::any_of(moves.begin(), moves.end(), [&](const RecordedMove& move) {
        return older.time < move.time && move.time < younger.time;
    });
    if (!was_moved) {
        return MergeInto(from.Get(), to.Get()) && unlinkat(all, name.c_str(), AT_REMOVEDIR) == 0;
    }
    NamesOverTime names(moves, older.time);
    return RenamedMerge(to.Get(), names.Until(younger.time)).Merge(from.Get()) &&
           (unlinkat(all, name.c_str(), AT_REMOVEDIR) == 0 || RenamedMerge::IsFull());
}

// What was moved before all that is kept tells nothing of it any more.
bool ForgetOldMoves(const std::string& folder, const std::vector<VersionFolder>& versions,
                    const std::vector<RecordedMove>& moves, const Retention& retention,
                    const VersionTime& now) {
    if (moves.empty()) {
        return true;
    }
    const int64_t newest =
        std::max(moves.back().time.seconds, versions.empty() ? 0 : versions.back().time.seconds);
    const int64_t kept = static_cast<int64_t>(retention.weekly) * kDaySeconds;
    return ForgetMoves(folder, {std::min(now.seconds, newest) - kept, 0});
}

}  // namespace

bool GiveUpVersion(const std::string& folder, const VersionFolder& version) {
    const VersionsLock lock(folder, LOCK_EX | LOCK_NB);
    return lock && Expire(lock.Folder(), NameOf(version)) && RemoveExpired(lock.Folder());
}

bool ThinVersions(const std::string& folder, const Retention& retention, const VersionTime& now) {
    const auto versions = ListVersions(folder);
    if (!versions) {
        return false;
    }
    const VersionsLock lock(folder, LOCK_EX | LOCK_NB);
    if (!lock) {
        return errno == ENOENT || errno == EWOULDBLOCK;
    }
    const auto moves = ListMoves(folder);
    if (!moves) {
        return false;
    }
    const int all = lock.Folder();
    const Thinning plan = PlanThinning(*versions, retention, now);
    bool done = true;
    for (const size_t i : plan.expired) {
        done = Expire(all, NameOf((*versions)[i])) && done;
    }
    for (const auto& [older, younger] : plan.merged) {
        // Nothing older goes into a folder before this has gone there whole: it would be replaced.
        if (!Merge(all, (*versions)[older], (*versions)[younger], *moves)) {
            done = false;
            break;
        }
    }
    done = RemoveExpired(all) && done;
    return ForgetOldMoves(folder, *versions, *moves, retention, now) && done;
}

}  // namespace zel_server
