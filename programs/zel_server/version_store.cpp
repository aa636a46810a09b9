#include "programs/zel_server/version_store.h"

#include <fcntl.h>
#include <sys/file.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <ctime>

#include "base/folder_names.h"
#include "base/text.h"
#include "programs/zel_server/file_tree.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/storage.h"

namespace zel_server {

namespace {

constexpr char kVersionsInStorage[] = ".versions";  // no share's folder begins with a dot
// "YYYYMMDDTHHMMSS" and ".NNNNNNNNN-"
constexpr size_t kDateLength = 15;
constexpr size_t kTimeLength = kDateLength + 1 + 9;
constexpr int32_t kNanosecondsOfASecond = 1000000000;
constexpr size_t kNanosecondDigits = 9;

}  // namespace

VersionTime VersionTime::Now() {
    timespec now = {};
    clock_gettime(CLOCK_REALTIME, &now);
    return {now.tv_sec, static_cast<int32_t>(now.tv_nsec)};
}

std::string TimeText(const VersionTime& time) {
    std::string fraction = std::to_string(time.nanoseconds);
    fraction.insert(0, kNanosecondDigits - fraction.size(), '0');
    return std::to_string(time.seconds) + "." + fraction;
}

std::optional<VersionTime> ParseTimeText(const std::string& text) {
    const size_t dot = std::min(text.find('.'), text.size());
    std::string fraction = dot < text.size() ? text.substr(dot + 1) : "0";
    if (fraction.size() > kNanosecondDigits) {
        return std::nullopt;
    }
    fraction.resize(kNanosecondDigits, '0');
    const auto seconds = base::ParseNumber(text.substr(0, dot), INT64_MAX);
    const auto nanoseconds = base::ParseNumber(fraction, kNanosecondsOfASecond - 1);
    if (!seconds || !nanoseconds) {
        return std::nullopt;
    }
    return VersionTime{static_cast<int64_t>(*seconds), static_cast<int32_t>(*nanoseconds)};
}

std::string VersionName(const VersionTime& time, const std::string& id) {
    const time_t seconds = static_cast<time_t>(time.seconds);
    struct tm date = {};
    char text[64] = "";
    if (gmtime_r(&seconds, &date) != nullptr) {
        const size_t length = strftime(text, sizeof text, "%Y%m%dT%H%M%S", &date);
        snprintf(text + length, sizeof text - length, ".%09d-", static_cast<int>(time.nanoseconds));
    }
    return text + id;
}

std::optional<VersionFolder> ParseVersionName(const std::string& name) {
    if (name.size() <= kTimeLength || name[kTimeLength] != '-') {
        return std::nullopt;
    }
    struct tm date = {};
    const char* const rest = strptime(name.c_str(), "%Y%m%dT%H%M%S", &date);
    const auto nanoseconds = base::ParseNumber(std::string_view(name).substr(kDateLength + 1, 9),
                                               kNanosecondsOfASecond - 1);
    if (rest != name.c_str() + kDateLength || !nanoseconds) {
        return std::nullopt;
    }
    VersionFolder version;
    version.time = {timegm(&date), static_cast<int32_t>(*nanoseconds)};
    version.id = name.substr(kTimeLength + 1);
    // One text for one time, whatever else strptime() takes.
    return IsVersionId(version.id) && VersionName(version.time, version.id) == name
               ? std::optional<VersionFolder>(std::move(version))
               : std::nullopt;
}

std::string VersionsLeftIn(const std::string& copy) {
    return copy + "/" + kVersionsInCopy;
}

std::string VersionsBelow(const std::string& storage) {
    return storage + "/" + kVersionsInStorage;
}

std::string VersionsOf(const std::string& share, const std::string& copy) {
    return VersionsBelow(FolderAbove(copy)) + "/" + ModuleKey(share);
}

base::UniqueFd HaveVersions(const std::string& share, const std::string& copy) {
    const base::UniqueFd storage = OpenFolder(AT_FDCWD, FolderAbove(copy));
    const base::UniqueFd all =
        storage ? HaveFolder(storage.Get(), kVersionsInStorage) : base::UniqueFd();
    return all ? HaveFolder(all.Get(), ModuleKey(share)) : base::UniqueFd();
}

std::optional<std::vector<VersionFolder>> ListVersions(const std::string& folder) {
    const base::UniqueFd open = OpenFolder(AT_FDCWD, folder);
    if (!open) {
        return errno == ENOENT ? std::optional<std::vector<VersionFolder>>(std::in_place)
                               : std::nullopt;
    }
    const auto names = base::NamesIn(open.Get());
    if (!names) {
        return std::nullopt;
    }
    const std::string top = folder + "/";
    std::vector<VersionFolder> versions;
    for (const std::string& name : *names) {
        if (auto version = ParseVersionName(name)) {
            version->path = top + name;
            versions.push_back(*std::move(version));
        }
    }
    std::sort(versions.begin(), versions.end());
    return versions;
}

VersionsLock::VersionsLock(const std::string& folder, int how)
    : folder_(OpenFolder(AT_FDCWD, folder)) {
    if (folder_ && flock(folder_.Get(), how) != 0) {
        folder_.Reset();
    }
}

}  // namespace zel_server
