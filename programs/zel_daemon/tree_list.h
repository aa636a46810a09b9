// Everything below a share's folder, in a fixed order.
#pragma once

#include <sys/types.h>

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "base/unique_fd.h"
#include "programs/zel_daemon/entry_facts.h"

namespace zel_daemon {

/// Lists a share's entries in the order of their keys (path_key.h), the folder itself included.
/// Links are not followed, other file systems are entered, and the names that the service keeps for
/// itself are left out. Of a folder some ten thousand names are held at a time, and nothing is held
/// open between two calls, so that volumes can be unmounted meanwhile.
///
/// Threads: one thread.
class TreeList {
public:
    enum class Found {
        kEntry,
        kUnreadable,  ///< what is in the folder `path`, which came before, cannot be read
        kEnd
    };
    struct Entry {
        std::string path;  ///< "/photos/a.jpg"; "/": the share's folder
        EntryFacts facts;
    };

    /// `start`: only this path and what is below it. `cancelled` ends the list early. Throws
    /// Failure when there is no such folder.
    TreeList(std::string folder, std::string start, std::function<bool()> cancelled);

    /// Throws Failure when another folder stands at the share's path by now.
    Found Next(Entry& entry);
    /// What is below the folder that came last is left out.
    void Skip() { enter_.reset(); }

private:
    struct Item {
        std::string name;
        ino_t inode;
        EntryFacts facts;
    };
    struct Level {
        std::string path;
        std::vector<Item> items;
        size_t at = 0;
        std::string last = {};  // of the names that were read
        bool more = true;       // others come after it
    };

    base::UniqueFd OpenShare();
    int Fill(Level& level);
    int ReadNames(int folder, Level& level) const;

    const std::string folder_;
    const std::string start_;
    const std::function<bool()> cancelled_;
    struct stat identity_ = {};
    bool begun_ = false;
    std::optional<std::string> enter_;  // the folder that comes next
    std::vector<Level> levels_;
};

}  // namespace zel_daemon
