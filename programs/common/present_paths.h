// How changed paths of a share are sent: some may have gone since they were reported.
#pragma once

#include <string>
#include <vector>

namespace programs {

/// How the server is told of what is gone.
enum class Deletions {
    kNamed,      ///< by its name
    kByEntries,  ///< by the entries of the folder that it was in
    kByTree      ///< by all that is below that folder
};

/// A path to send, and the ordered paths that it covers.
struct PresentPath {
    enum class Kind {
        kWhole,    ///< as it is, with all that is below it
        kGone,     ///< to be deleted
        kEntries,  ///< a folder, by its own entries
        kBytes  ///< a file, by its bytes, as its size and time tell nothing; none of PresentPaths'
    };
    std::string path;
    std::vector<std::string> ordered;
    Kind kind = Kind::kWhole;
    bool is_folder = false;  ///< deletions may be made in it
};

/// The fewest paths that cover all of `ordered`, folders before what is in them. "/" is the share's
/// `folder` itself; others begin with "/". What is gone is the highest path that is, however deep
/// below it the ordered one lies. Names that are reserved in a share are left out. No path is below
/// another one that is kWhole or kGone, and none leads through a symbolic link: what an ordered
/// path would reach through one, or through a file, is covered by that link or file.
///
/// Costs: n log n, and a look-up or two for each path.
std::vector<PresentPath> PresentPaths(const std::string& folder,
                                      const std::vector<std::string>& ordered,
                                      Deletions deletions = Deletions::kByTree);

}  // namespace programs
