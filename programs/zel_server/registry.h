// The pairing registry as the server's programs use it: a section as a map, changed under one lock.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "ZEL/zel.h"

namespace zel_server {

using Section = std::map<std::string, std::string>;

/// The client has said that its push ended without being complete; rsync's own word has not come
/// yet.
inline constexpr char kEndedByClient[] = "ended";
/// The section was lost with what it said of the last push, and made again from the share's module.
inline constexpr char kMended[] = "mended";

/// A share's section. `RunningID` and `CompleteID` are the library's keys; the others are this
/// program's own.
struct ShareState {
    std::string running_id;   ///< client that pushes into it now; empty: none
    std::string complete_id;  ///< client that last completed a push
    std::string account;      ///< account that it belongs to
    std::string module;       ///< its rsync module
    std::string path;         ///< its folder
    std::string last_result;  ///< rsync's exit status of the last push, kEndedByClient or kMended
    std::string last_time;    ///< when that was, in seconds since the epoch

    /// The client that it belongs to; empty for a share that nobody has begun.
    std::string Owner() const { return running_id.empty() ? complete_id : running_id; }
};

/// Serialises every read-change-write of the registry between the server's processes while it
/// lives.
class RegistryLock {
public:
    RegistryLock();
    /// False when the lock file cannot be made: nothing may be changed then.
    bool Held() const { return held_; }

private:
    ZEL::SimpleFileLock lock_;
    bool held_;
};

/// How a read went; a section that is not there is an empty one. kDamaged: the section has lost
/// something, or is not there although it has been; nobody may be let in on its word.
enum class ReadResult { kRead, kMissing, kDamaged, kFailed };

/// Never kDamaged: it takes what is there.
ReadResult ReadSection(const std::string& name, Section& section);
/// Names of all sections, in file order; nothing when the registry cannot be read.
std::optional<std::vector<std::string>> SectionNames();

/// Sections are never removed, and each has all of its keys: what lacks one was cut off. Of a share
/// without a section its module (see share_module.h) tells that there was one.
ReadResult ReadShare(const std::string& share, ShareState& state);
bool WriteShare(const std::string& share, const ShareState& state);
/// The share of that rsync module: an encrypted one's is the name between two "@".
std::string ShareOfModule(const std::string& module);

bool WriteTaskStatus(const std::string& task, const std::string& status);

/// What the admin has made of the service. kUnknown: it cannot be read, or set-up's word is lost.
enum class Switch { kOn, kOff, kUnknown };
Switch ReadSwitch();

/// Whether the client has been accepted, as the single client or as one of several. kFailed: cannot
/// be read.
enum class Paired { kYes, kNo, kFailed };
Paired IsPaired(const std::string& client_id);

}  // namespace zel_server
