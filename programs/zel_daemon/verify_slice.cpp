#include "programs/zel_daemon/verify_slice.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <memory>
#include <optional>
#include <string_view>

#include "base/open_beneath.h"
#include "base/unique_fd.h"
#include "programs/common/failure.h"
#include "tarq/rsync_wrapper.h"

namespace zel_daemon {

namespace {

// So many entries are looked at for each file that a slice may have, and so many besides.
constexpr size_t kEntriesPerFile = 20;
constexpr size_t kEntriesBesides = 10000;

struct FolderCloser {
    void operator()(DIR* folder) const { closedir(folder); }
};
using Folder = std::unique_ptr<DIR, FolderCloser>;

class Walk {
public:
    Walk(int root, const SliceLimits& limits, const std::function<bool()>& cancelled)
        : root_(root), limits_(limits), cancelled_(cancelled) {}

    // All below the folder `path` that comes after `place`, relative to it. False: the slice is
    // full.
    bool Below(const std::string& path, const std::string& place) {
        const std::string top = path.empty() ? "" : path + "/";
        const size_t slash = std::min(place.find('/'), place.size());
        std::string from = place.substr(0, slash);
        const std::string rest = slash < place.size() ? place.substr(slash + 1) : "";
        for (bool first = !from.empty(), more = true; more; first = false) {
            std::vector<std::string> names = NamesFrom(path, from, first, more);
            for (const std::string& name : names) {
                const bool is_place = first && name == from;
                if (!Enter(top + name, is_place, is_place ? rest : "")) {
                    return false;
                }
            }
            if (names.empty()) {
                break;
            }
            from = std::move(names.back());
        }
        return true;
    }

    Slice Take() { return std::move(slice_); }

private:
    // The first names of the folder after `from`, or at it. `more`: there are others.
    std::vector<std::string> NamesFrom(const std::string& path, const std::string& from,
                                       bool with_from, bool& more) const {
        const size_t most = limits_.files + 1;
        more = false;
        std::vector<std::string> names;  // a heap with the last name on top
        const Folder folder = Open(path);
        while (const dirent* const entry =
                   folder && !cancelled_() ? readdir(folder.get()) : nullptr) {
            const std::string_view name = entry->d_name;
            if (name == "." || name == ".." || name == TARQ::Backup::kResumedFolder ||
                name < from || (name == from && !with_from) ||
                (path.empty() && name == TARQ::Backup::kVersionsFolder)) {
                continue;
            }
            if (names.size() == most) {
                more = true;
                if (name >= names.front()) {
                    continue;
                }
                std::pop_heap(names.begin(), names.end());
                names.pop_back();
            }
            names.emplace_back(name);
            std::push_heap(names.begin(), names.end());
        }
        std::sort_heap(names.begin(), names.end());
        return names;
    }

    Folder Open(const std::string& path) const {
        base::UniqueFd fd = base::OpenBeneath(root_, path, O_RDONLY | O_DIRECTORY);
        Folder folder(fd ? fdopendir(fd.Get()) : nullptr);
        if (folder) {
            fd.Release();
        }
        return folder;
    }

    // One entry, and what is below it. `was_seen`: an earlier slice has had it itself.
    bool Enter(const std::string& path, bool was_seen, const std::string& place) {
        if (cancelled_() || ++seen_ > kEntriesPerFile * limits_.files + kEntriesBesides) {
            return false;
        }
        struct stat info = {};
        const base::UniqueFd entry = base::OpenBeneath(root_, path, O_PATH);
        const bool known = entry && fstat(entry.Get(), &info) == 0;
        if (known && !was_seen && S_ISREG(info.st_mode)) {
            const auto bytes = static_cast<uint64_t>(info.st_size);
            const bool fits = slice_.files.empty() || (slice_.files.size() < limits_.files &&
                                                       slice_.bytes < limits_.bytes &&
                                                       bytes <= limits_.bytes - slice_.bytes);
            if (!fits) {
                return false;
            }
            slice_.files.push_back(path);
            slice_.bytes += bytes;
        }
        slice_.end = path;
        return !known || !S_ISDIR(info.st_mode) || Below(path, place);
    }

    const int root_;
    const SliceLimits limits_;
    const std::function<bool()>& cancelled_;
    size_t seen_ = 0;
    Slice slice_;
};

}  // namespace

Slice TakeSlice(const std::string& folder, const std::string& place, const SliceLimits& limits,
                const std::function<bool()>& cancelled) {
    const base::UniqueFd root(open(folder.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!root) {
        throw programs::SystemFailure("cannot open " + folder, programs::FailureKind::kLocal);
    }
    Walk walk(root.Get(), limits, cancelled);
    const bool all = walk.Below("", place);
    Slice slice = walk.Take();
    slice.is_last = all;
    return slice;
}

// A slash is less than any byte of a name.
bool ComesBefore(const std::string& one, const std::string& other) {
    return std::lexicographical_compare(
        one.begin(), one.end(), other.begin(), other.end(), [](char a, char b) {
            const auto rank = [](char c) { return c == '/' ? 0 : static_cast<unsigned char>(c); };
            return rank(a) < rank(b);
        });
}

}  // namespace zel_daemon
