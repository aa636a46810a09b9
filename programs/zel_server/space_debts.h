// What accounts owe for having written where space is short: version_space.h says why.
//
//     /var/run/zel_server/.space/ACCOUNT@STORAGE    bytes owed, and bytes missed, in decimal digits
//     /var/run/zel_server/.space/.due               there since somebody began to owe more
//
// A reboot forgets it; the next transfers begin anew.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace zel_server {

struct SpaceDebt {
    std::string account;
    std::string storage;  ///< one of ServerConfig::Folders()
    uint64_t bytes = 0;
    /// All that was free was too little for its last transfer, which failed: so many are to be free
    /// besides, whatever the reserve.
    uint64_t missed = 0;
};

/// Whether less than `reserve` percent of the disk of `storage` are free.
bool IsSpaceShort(const std::string& storage, uint64_t reserve);

/// The bytes that the rsync daemon of a connection, the process `number`, and its children have
/// written, to files and otherwise (guard/children.cpp); 0 when the kernel does not say.
uint64_t BytesWrittenBy(const std::string& number);

/// At the end of a transfer of the account that wrote into the folder `storage`: adds to what it
/// owes there, or forgives it where space is not short. `failed`: it could not write all, and has
/// removed what was not whole. With the registry's lock held.
void NoteWritten(const std::string& account, const std::string& storage, uint64_t bytes,
                 bool failed);

/// Whether somebody owes more than at the last SpaceDebts().
bool IsSpaceDue();

/// All debts. They are not due any more.
std::vector<SpaceDebt> SpaceDebts();

/// Takes `paid` bytes from what is owed by now. With the registry's lock held.
void PaySpaceDebt(const SpaceDebt& debt, uint64_t paid);

}  // namespace zel_server
