#include "programs/zelctl/restore/share_place.h"

#include <algorithm>
#include <filesystem>
#include <system_error>
#include <vector>

#include "programs/common/host.h"
#include "programs/common/text.h"
#include "tarq/share.h"

namespace zelctl {

namespace {

namespace fs = std::filesystem;
using programs::ListedShare;
using programs::Printable;

// What lies there decides what this machine runs and who enters it. Whoever has the account's
// password could name such a folder, and what comes into it.
constexpr const char* kSystemFolders[] = {"/bin",   "/boot",  "/dev",    "/etc",  "/lib",
                                          "/lib32", "/lib64", "/libx32", "/proc", "/root",
                                          "/run",   "/sbin",  "/sys",    "/usr",  "/var/spool"};

bool IsBelow(const fs::path& path, const fs::path& folder) {
    return std::mismatch(folder.begin(), folder.end(), path.begin(), path.end()).first ==
           folder.end();
}

bool IsOfTheSystem(const fs::path& folder) {
    // A hidden folder on the way holds somebody's keys and settings.
    return folder == folder.root_path() ||
           std::any_of(std::begin(kSystemFolders), std::end(kSystemFolders),
                       [&](const char* system) { return IsBelow(folder, system); }) ||
           std::any_of(folder.begin(), folder.end(),
                       [](const fs::path& name) { return name.string().front() == '.'; });
}

// Whether the volume that the share was on is mounted where it was.
bool IsMounted(const std::string& volume) {
    TARQVolumePath found = {};
    return volume.empty() || volume == "/" ||
           (VolumePathParseEx(volume.c_str(), &found) == 0 && found.path == volume);
}

// Why a share that this machine has not cannot be made; empty when it can.
std::string ProblemOf(const ListedShare& share) {
    if (share.encrypted) {
        return "it is kept encrypted, by the system: make it there";
    }
    if (!IsMounted(share.volume)) {
        return "its disk was mounted at " + Printable(share.volume) +
               " and is not there: mount it or, where its folder is another one now, say 'zelctl "
               "share add'";
    }
    std::error_code error;
    const fs::path resolved = fs::weakly_canonical(share.folder, error);
    if (error || IsOfTheSystem(resolved)) {
        return Printable(share.folder) +
               " is a folder of the system's, or hidden: if that is right, say 'zelctl share add'";
    }
    const fs::file_status status = fs::status(share.folder, error);
    return status.type() == fs::file_type::directory || status.type() == fs::file_type::not_found
               ? ""
               : Printable(share.folder) + " is no folder";
}

}  // namespace

SharePlace PlaceOf(const ListedShare& share) {
    SharePlace place;
    place.folder = share.folder;
    const std::vector<ListedShare> here = programs::ListedShares();
    const auto listed = std::find_if(here.begin(), here.end(), [&](const ListedShare& other) {
        return other.name == share.name;
    });
    if (listed != here.end()) {
        place.in_catalogue = true;
        place.folder = listed->folder;
        place.problem = programs::ShareProblem(share.name);
    } else if (share.folder.empty()) {
        place.problem = "its folder is not known: 'zelctl share add' tells where it is";
    } else {
        place.problem = ProblemOf(share);
    }
    std::error_code error;
    place.is_there = fs::is_directory(place.folder, error);
    place.is_filled = place.is_there && !fs::is_empty(place.folder, error);
    return place;
}

}  // namespace zelctl
