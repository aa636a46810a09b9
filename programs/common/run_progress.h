// The progress of a push: its form in messages, and its text for people.
#pragma once

#include <string>
#include <vector>

#include "ZEL/pobject.h"
#include "tarq/rsync_wrapper.h"

namespace programs {

/// The keys `progress_...` of docs/daemon-protocol.md.
const std::vector<std::string>& ProgressKeys();
/// Sets those of the keys that have a value.
void AddProgress(const std::string& share, const TARQ::Backup::RunProgress& progress,
                 ZEL::PObject& map);
/// The reverse; inconsistent numbers are corrected.
TARQ::Backup::RunProgress ProgressOf(const ZEL::PObject& map);

/// Whether there was no progress for so long that a person should know.
bool IsStalled(const TARQ::Backup::RunProgress& progress);

/// The state of a running push, for a table: "running 45%" (of its bytes), "running, 99% checked"
/// (of its files), "nothing has moved for 2:10".
std::string ProgressState(const TARQ::Backup::RunProgress& progress);

/// A line of at most `columns`, beginning with `what`: bytes and the remaining time if the amount
/// to send is known, otherwise files checked and bytes sent. Safe on a terminal.
std::string ProgressLine(const std::string& what, const TARQ::Backup::RunProgress& progress,
                         size_t columns);
/// The full text, without `what` and without a bar.
std::string ProgressWords(const TARQ::Backup::RunProgress& progress);

}  // namespace programs
