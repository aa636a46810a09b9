#include "programs/common/mounts_below.h"

#include <fcntl.h>

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <map>
#include <memory>
#include <sstream>

#include "base/unique_fd.h"
#include "base/whole_file.h"
#include "programs/common/failure.h"
#include "programs/common/share_notes.h"

namespace programs {

namespace {

constexpr char kTable[] = "/proc/self/mountinfo";
constexpr size_t kMaxTable = size_t{64} << 20;

struct Mount {
    std::string parent;
    std::string device;
    std::string root;
    std::string point;
    std::string type;
};

// Blanks, line breaks and backslashes are three octal digits there.
std::string Unescaped(const std::string& text) {
    std::string plain;
    for (size_t i = 0; i < text.size(); ++i) {
        if (text[i] == '\\' && i + 3 < text.size()) {
            plain += static_cast<char>(strtol(text.substr(i + 1, 3).c_str(), nullptr, 8));
            i += 3;
        } else {
            plain += text[i];
        }
    }
    return plain;
}

// By the kernel's number of the mount.
std::map<std::string, Mount> ReadTable() {
    const auto text = base::ReadFile(kTable, kMaxTable);
    if (!text) {
        throw SystemFailure(std::string("cannot read ") + kTable, FailureKind::kLocal);
    }
    std::map<std::string, Mount> table;
    std::istringstream lines(*text);
    for (std::string line; std::getline(lines, line);) {
        std::istringstream words(line);
        std::string id;
        std::string root;
        std::string point;
        Mount mount;
        words >> id >> mount.parent >> mount.device >> root >> point;
        for (std::string word; words >> word && word != "-";) {
        }
        words >> mount.type;
        mount.root = Unescaped(root);
        mount.point = Unescaped(point);
        table[id] = std::move(mount);
    }
    return table;
}

// `path` within `above`: "/x" for "/a/x" in "/a".
std::string Within(const std::string& path, const std::string& above) {
    return above == "/" ? path : path.substr(above.size());
}

std::string Joined(const std::string& folder, const std::string& within) {
    return folder == "/" ? within : folder + within;
}

// A service's confinement mounts folders onto themselves.
bool IsOntoItself(const Mount& mount, const std::map<std::string, Mount>& table) {
    const auto below = table.find(mount.parent);
    return below != table.end() && mount.device == below->second.device &&
           IsAtOrBelow(mount.point, below->second.point) &&
           mount.root == Joined(below->second.root, Within(mount.point, below->second.point));
}

bool Contains(const std::vector<std::string>& items, const std::string& item) {
    return std::find(items.begin(), items.end(), item) != items.end();
}

// Whether one of the patterns leaves behind the path, or a folder above it: only patterns that name
// a path are known to.
bool IsExcluded(const std::string& path, const std::vector<std::string>& excludes) {
    return std::any_of(excludes.begin(), excludes.end(), [&](std::string pattern) {
        while (pattern.size() > 1 && (pattern.back() == '/' || pattern.back() == '*')) {
            pattern.pop_back();
        }
        return pattern.size() > 1 && pattern.front() == '/' && IsAtOrBelow(path, pattern);
    });
}

}  // namespace

bool IsAtOrBelow(const std::string& path, const std::string& above) {
    return above == "/" || (path.compare(0, above.size(), above) == 0 &&
                            (path.size() == above.size() || path[above.size()] == '/'));
}

MountTable::MountTable() {
    const auto table = ReadTable();
    for (const auto& [id, mount] : table) {
        if (mount.type != "autofs" && !IsOntoItself(mount, table)) {
            points_.push_back(mount.point);
        }
    }
    std::sort(points_.begin(), points_.end());
    points_.erase(std::unique(points_.begin(), points_.end()), points_.end());
}

std::vector<std::string> MountTable::Below(const std::string& folder) const {
    const std::unique_ptr<char, decltype(&free)> real(realpath(folder.c_str(), nullptr), free);
    if (!real) {
        throw SystemFailure("cannot find " + folder, FailureKind::kLocal);
    }
    const std::string above = real.get();
    std::vector<std::string> mounts;
    for (const std::string& point : points_) {
        if (point != above && IsAtOrBelow(point, above)) {
            mounts.push_back(Within(point, above));
        }
    }
    return mounts;
}

std::vector<std::string> MissingMounts(const std::string& share, const std::string& folder,
                                       const std::vector<std::string>& excludes) {
    const std::vector<std::string> noted = ReadShareNotes(share).mounts;
    std::vector<std::string> present = MountTable().Below(folder);
    const auto is_away = [&](const std::string& mount) { return !Contains(present, mount); };
    if (std::any_of(noted.begin(), noted.end(), is_away)) {
        // An automounter mounts what somebody looks at.
        for (const std::string& mount : noted) {
            const base::UniqueFd looked(
                open((folder + mount + "/.").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        }
        present = MountTable().Below(folder);
    }
    if (std::any_of(present.begin(), present.end(),
                    [&](const std::string& mount) { return !Contains(noted, mount); })) {
        ChangeShareNotes(share, [&](ShareNotes& notes) {
            for (const std::string& mount : present) {
                if (!Contains(notes.mounts, mount)) {
                    notes.mounts.push_back(mount);
                }
            }
        });
    }
    std::vector<std::string> missing;
    for (const std::string& mount : noted) {
        if (is_away(mount) && !IsExcluded(mount, excludes)) {
            missing.push_back(mount);
        }
    }
    return missing;
}

std::string PatternOf(const std::string& path) {
    // rsync takes a backslash as it stands in a pattern without wildcards.
    if (path.find_first_of("*?[") == std::string::npos) {
        return path;
    }
    std::string pattern;
    for (const char c : path) {
        pattern += std::string(c == '*' || c == '?' || c == '[' || c == '\\' ? "\\" : "") + c;
    }
    return pattern;
}

std::vector<std::string> Without(const std::vector<std::string>& away,
                                 std::vector<std::string> excludes) {
    for (const std::string& mount : away) {
        excludes.push_back(PatternOf(mount));
    }
    return excludes;
}

}  // namespace programs
