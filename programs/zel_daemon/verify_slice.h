// A part of a share's files, in a fixed order: what one step of a verification reads.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace zel_daemon {

/// How much a slice has at most. A file that is larger than `bytes` has a slice of its own.
struct SliceLimits {
    size_t files = 0;
    uint64_t bytes = 0;
};

struct Slice {
    std::vector<std::string> files;  ///< regular files, relative to the share's folder
    uint64_t bytes = 0;              ///< in them
    std::string end;                 ///< the last entry that was looked at; empty: there was none
    bool is_last = false;            ///< nothing comes after it
};

/// The files that come after the entry `place` ("": all). The order is that of names by their
/// bytes, folders before what is in them; `place` need not be there any more. Only the folders on
/// the way to it are read to find it, and of a folder with very many entries no more names are kept
/// than a slice needs. Links are not followed; what cannot be read is passed over, as are the names
/// that the service keeps for itself. A slice may be empty, and more come after it: where there are
/// many folders and few files.
///
/// `cancelled` ends it early, as the last; its outcome is of no use then. Throws Failure (kLocal)
/// when there is no such folder.
Slice TakeSlice(const std::string& folder, const std::string& place, const SliceLimits& limits,
                const std::function<bool()>& cancelled);

/// Whether entry `one` comes before `other`.
bool ComesBefore(const std::string& one, const std::string& other);

}  // namespace zel_daemon
