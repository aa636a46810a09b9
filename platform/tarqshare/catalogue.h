// The share catalogue: /usr/tarq/etc/tarqshare.conf below the root folder, a section a share.
#pragma once

#include <tarq/core.h>

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "base/file_lock.h"
#include "base/folder_identity.h"
#include "platform/tarqshare/volume.h"

namespace tarq_share {

/// A share as its section describes it.
struct Share {
    std::string name;
    std::string path;               ///< absolute; empty when the section names none
    unsigned int flags = 0;         ///< TARQShareFlag bits and any other bits that the section has
    int key_length = 0;             ///< bits
    std::string encrypted_path;     ///< encrypted shares: the folder of the encrypted form
    std::string key_file;           ///< exported key, set or by default
    std::string auto_key_file;      ///< key for opening at start-up, set or by default
    Volume volume;                  ///< as recorded; nothing was when the mount point is empty
    base::FolderIdentity identity;  ///< as recorded; nothing was when the file system is empty

    bool IsEncrypted() const;
    /// The folder whose files travel: the encrypted form's, where there is one.
    const std::string& DataFolder() const { return IsEncrypted() ? encrypted_path : path; }
};

/// The facts by which `share` is recognised, with their keys in the catalogue.
std::vector<std::pair<const char*, std::string>> FactsOf(const Share& share);

/// Sets each of them in `into`. False with the error code set.
bool AddFacts(const Share& share, KAPICSzHash into);

/// Whether a share may be given this name: see TARQShareAdd.
bool IsShareName(const std::string& name);

/// Flag words as text: "encrypted|acl", "0x82", "130", also mixed; blanks, commas and "|" separate
/// them. Nothing when a word is not known: an encrypted share must not be taken for a plain one.
std::optional<unsigned int> ParseFlags(const std::string& text);
std::string FormatFlags(unsigned int flags);

/// The folder that holds the encrypted form of the share in `path` unless the catalogue says
/// otherwise: /volume1/docs has /volume1/@docs@.
std::string DefaultEncryptedPath(const std::string& path);

/// Reads one share, or nothing with the error code set.
std::optional<Share> ReadShare(const std::string& name);
/// The names of all shares in the catalogue's order, or nothing with the error code set.
std::optional<std::vector<std::string>> ReadShareNames();
/// Appends a share's section. Only with the lock held. False with the error code set.
bool WriteShare(const Share& share);
/// Records in a share's section what it is known by now; its other keys stay. Only with the lock
/// held. False with the error code set.
bool WriteFacts(const Share& share);
/// Takes a share's section out. Only with the lock held. False with the error code set.
bool EraseShare(const std::string& name);

/// The right to write the catalogue, among all processes and threads.
class CatalogueLock {
public:
    enum class Patience { kWait, kNone };
    explicit CatalogueLock(Patience patience = Patience::kWait);
    /// False, with the error code set, when the lock cannot be had.
    explicit operator bool() const { return static_cast<bool>(lock_); }

private:
    base::FileLock lock_;
};

}  // namespace tarq_share
