// The pairing registry as the server's programs use it: sections as maps, changed under one lock.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "base/file_lock.h"

namespace zel_server {

using Section = std::map<std::string, std::string>;

/// The client has reported that its push ended incomplete, and rsync no exit status.
inline constexpr char kEndedByClient[] = "ended";
/// The section was lost, and restored from the share's record; the last push is not known.
inline constexpr char kMended[] = "mended";

/// A share's section. `RunningID` and `CompleteID` are the library's keys; the others are this
/// program's own.
struct ShareState {
    std::string running_id;   ///< client that is pushing into it; empty: none
    std::string complete_id;  ///< client that last completed a push
    std::string account;      ///< account that it belongs to
    std::string module;       ///< its rsync module
    std::string path;         ///< its folder
    std::string last_result;  ///< rsync's exit status of the last push, kEndedByClient or kMended
    std::string last_time;    ///< when that was, in seconds since the epoch

    /// The client that it belongs to; empty for a share that nobody has pushed yet.
    std::string Owner() const { return running_id.empty() ? complete_id : running_id; }
};

/// While it exists, no other process of the server can read and change the registry.
class RegistryLock {
public:
    RegistryLock();
    /// False when the lock file cannot be made, or another process has held the lock for half a
    /// minute (which is logged): then nothing may be changed.
    bool Held() const { return static_cast<bool>(lock_); }

private:
    base::FileLock lock_;
};

/// The result of a read; a missing section reads as empty. kDamaged: the section is incomplete, or
/// is missing though it once existed; nobody may be admitted on the strength of it.
enum class ReadResult { kRead, kMissing, kDamaged, kFailed };

/// Never kDamaged: the section is not checked.
ReadResult ReadSection(const std::string& name, Section& section);
/// Replaces or adds a section; removes one. Called with the registry's lock held; false on failure.
bool WriteSection(const std::string& name, const Section& section);
bool RemoveSection(const std::string& name);
/// Names of all sections, in file order; nothing when the registry cannot be read.
std::optional<std::vector<std::string>> SectionNames();

/// The section of a share is never removed and always has all of its keys, so one that lacks a key
/// is damaged. When a share has no section, its record (see share_record.h) tells that there was
/// one.
ReadResult ReadShare(const std::string& share, ShareState& state);
bool WriteShare(const std::string& share, const ShareState& state);
/// Records that the push into the share has ended, complete or not. `state`: the share's current
/// one.
bool EndPush(const std::string& share, ShareState state, bool completed);
/// The share of that rsync module; the module of an encrypted share is its name between two "@".
std::string ShareOfModule(const std::string& module);

/// Whether the admin has switched the service on. kUnknown: unreadable, or the entry was lost.
enum class Switch { kOn, kOff, kUnknown };
Switch ReadSwitch();

}  // namespace zel_server
