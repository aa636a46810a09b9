// A record of each share outside the registry: its owner, and which copy it has.
//
// With it the registry's entry for a share can be restored when it is lost, and a lost share can be
// told from a new one. A record is a small file, replaced atomically and never removed. Its name is
// the share's as the rsync daemon compares names (ModuleKey), so that one look tells whether a name
// is taken.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/folder_identity.h"
#include "programs/zel_server/registry.h"

namespace zel_server {

/// Which copy a share has, and how far its pushes have come. Only the server writes this, outside
/// of the copy itself: a client compares it with what it has noted.
struct CopyState {
    std::string identity;     ///< 128 random bits, see base::RandomDigits(); empty: none given yet
    uint64_t generation = 0;  ///< pushes that were completed into this copy
    std::string push;   ///< the client's mark of the last push that began; empty: it gave none
    int64_t since = 0;  ///< when the copy began, in seconds since the epoch
    base::FolderIdentity folder;  ///< as it was when the copy began
};

struct ShareRecord {
    std::string share;
    std::string module;
    std::string path;
    bool names_owner = false;  ///< false for a record that an early version wrote
    std::string account;       ///< empty, together with `client`: owned by nobody
    std::string client;        ///< empty with an account: no client has pushed yet
    CopyState copy;
};

/// Writes the record of a share unless it is up to date. Call it only after the share's section in
/// the registry was written: a record without a section means that the section was lost.
bool WriteShareRecord(const std::string& share, const ShareState& state, const CopyState& copy);

/// Whether the share has a record. One that cannot be read counts as the share's.
bool HasShareRecord(const std::string& share);

/// Nothing when there is no record, or it is unreadable or incomplete.
std::optional<ShareRecord> ReadShareRecord(const std::string& share);

/// The copy in the share's record; a default one when there is none.
CopyState RecordedCopy(const std::string& share);

/// Whether another share already uses an equivalent name, as compared by the rsync daemon and by
/// case-insensitive file systems.
bool IsNameOfAnother(const std::string& share);

/// The shares that have a record, sorted; nothing when the folder cannot be read.
std::optional<std::vector<std::string>> RecordedShares();

/// Converts the module files of earlier versions into records, and removes the files. Called with
/// the registry's lock held. An interrupted run is simply repeated: no module file is removed
/// before all records are on disk. False, with errno set, when something cannot be written; then no
/// file was removed.
bool TakeOverOldModules();

}  // namespace zel_server
