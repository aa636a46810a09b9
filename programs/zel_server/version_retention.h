// How long a share's versions are kept.
//
// All of them for a while, then one a day, then one a week, and then none. Folders are thinned by
// merging each into the next later one of its day or week: of a path that both have, the older
// version stays, because it is what stood there at any time before the first of the two. So the
// tree of every time before the first folder of a day or week, or after the last, stays exactly as
// it was, and only the states in between are given up.
//
// Where something was moved between two folders of versions (copy_moves.h), each version goes to
// the path that its file had by the time of the later one. What has none there, because something
// else was moved into its place or it would replace a folder, stays in its own folder.
//
// An interruption at any moment leaves the trees of all times that are kept as they were: a version
// is moved by one rename, and a folder that expires loses its name before its files.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "programs/zel_server/version_store.h"

namespace zel_server {

inline constexpr int64_t kDaySeconds = int64_t{24} * 60 * 60;

/// Ages in days, none smaller than the one before it.
struct Retention {
    uint64_t all = 1;       ///< up to here every version is kept
    uint64_t daily = 30;    ///< up to here one a day
    uint64_t weekly = 365;  ///< up to here one a week
};
/// "all=1d,daily=30d,weekly=1y": any of the three, in days (d), weeks (w) or years of 365 days (y);
/// what is not named keeps its default. Nothing for any other text.
std::optional<Retention> ParseRetention(const std::string& text);
/// In the form that ParseRetention() reads.
std::string RetentionText(const Retention& retention);

/// "7d", "2w" or "1y" in days; nothing for any other text.
std::optional<uint64_t> ParseAge(std::string_view text);

/// What the admin has chosen (server.conf, section "versions").
struct KeepSettings {
    Retention retention;
    /// Days: no version that is younger is given up for space.
    uint64_t at_least = 7;
    /// Percent of a storage's disk that are to be free: version_space.h.
    uint64_t reserve = 10;
};
inline constexpr uint64_t kMaxReserve = 50;
/// Nothing when they cannot be read or make no sense: then no version may be given up.
std::optional<KeepSettings> ReadKeepSettings();
/// False, with errno set, on failure.
bool WriteKeepSettings(const KeepSettings& settings);

/// What is to be done with folders of versions, by their places in the list.
struct Thinning {
    std::vector<size_t> expired;
    /// The first into the second, in this order.
    std::vector<std::pair<size_t, size_t>> merged;
};
/// From when the ages of `versions`, the oldest first, are counted: from the newest of them, or
/// from `now` when that is earlier. So a clock that runs ahead, or a share that nobody pushes any
/// more, costs no version.
int64_t AgesFrom(const std::vector<VersionFolder>& versions, const VersionTime& now);
Thinning PlanThinning(const std::vector<VersionFolder>& versions, const Retention& retention,
                      const VersionTime& now);

/// Thins the versions in `folder` (VersionsOf()). False, with errno set, when that failed in part;
/// the next call goes on. Does nothing while somebody reads them.
bool ThinVersions(const std::string& folder, const Retention& retention, const VersionTime& now);

/// Gives up one of them, whatever its age. False, with errno set, when some of it is left: the next
/// ThinVersions() goes on; EWOULDBLOCK while somebody reads them.
bool GiveUpVersion(const std::string& folder, const VersionFolder& version);

}  // namespace zel_server
