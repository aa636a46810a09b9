#include "programs/zel_server/version_report.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstdio>
#include <nlohmann/json.hpp>
#include <vector>

#include "base/folder_names.h"
#include "programs/common/failure.h"
#include "programs/common/json_text.h"
#include "programs/common/table.h"
#include "programs/common/text.h"
#include "programs/zel_server/file_tree.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/registry_repair.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

namespace {

void AddSize(const base::UniqueFd& folder, VersionSize& size) {
    const auto names = base::NamesIn(folder.Get());
    for (const std::string& name : names.value_or(std::vector<std::string>())) {
        struct stat info = {};
        if (fstatat(folder.Get(), name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0) {
            continue;
        }
        if (!S_ISDIR(info.st_mode)) {
            ++size.files;
            size.bytes += static_cast<uint64_t>(info.st_size);
        } else if (const base::UniqueFd below = OpenFolder(folder.Get(), name)) {
            AddSize(below, size);
        }
    }
}

}  // namespace

VersionSize SizeOf(const VersionFolder& version) {
    VersionSize size;
    if (const base::UniqueFd folder = OpenFolder(AT_FDCWD, version.path)) {
        AddSize(folder, size);
    }
    return size;
}

void ShowVersions(const std::string& share, bool as_json) {
    RequireServerConfig();
    const auto shares = KnownShares();
    if (!shares) {
        throw programs::SystemFailure("cannot read the registry " + RegistryFile());
    }
    if (!share.empty() && std::find(shares->begin(), shares->end(), share) == shares->end()) {
        throw programs::Failure("there is no share '" + programs::Printable(share) +
                                "': see 'zel_server shares'");
    }
    programs::Table summary({"SHARE", "VERSIONS", "OLDEST", "NEWEST", "FILES", "SIZE"});
    programs::Table each({"TIME", "FILES", "SIZE"});
    nlohmann::ordered_json rows = nlohmann::ordered_json::array();
    for (const std::string& name : *shares) {
        ShareState state;
        if ((!share.empty() && name != share) || ReadShare(name, state) != ReadResult::kRead) {
            continue;
        }
        const auto versions = ListVersions(VersionsOf(name, state.path));
        if (!versions) {
            throw programs::SystemFailure("cannot read the versions of share '" +
                                          programs::Printable(name) + "'");
        }
        VersionSize total;
        for (const VersionFolder& version : *versions) {
            const VersionSize size = SizeOf(version);
            total.files += size.files;
            total.bytes += size.bytes;
            rows.push_back({{"share", name},
                            {"time", version.time.seconds},
                            {"files", size.files},
                            {"bytes", size.bytes},
                            {"folder", version.path}});
            each.Add({programs::HumanTime(version.time.seconds), std::to_string(size.files),
                      programs::HumanBytes(size.bytes)});
        }
        const bool none = versions->empty();
        summary.Add({name, std::to_string(versions->size()),
                     none ? "" : programs::HumanTime(versions->front().time.seconds),
                     none ? "" : programs::HumanTime(versions->back().time.seconds),
                     std::to_string(total.files), programs::HumanBytes(total.bytes)});
    }
    if (as_json) {
        puts(programs::JsonText(rows).c_str());
    } else {
        (share.empty() ? summary : each).Print(false);
    }
}

}  // namespace zel_server
