// How far a push has come: how that travels, and how a person reads it.
#pragma once

#include <string>
#include <vector>

#include "ZEL/pobject.h"
#include "tarq/rsync_wrapper.h"

namespace programs {

/// The keys `progress_...` of docs/daemon-protocol.md.
const std::vector<std::string>& ProgressKeys();
/// Sets those of them that there is something to say in.
void AddProgress(const std::string& share, const TARQ::Backup::RunProgress& progress,
                 ZEL::PObject& map);
/// The reverse; numbers that make no sense are made to.
TARQ::Backup::RunProgress ProgressOf(const ZEL::PObject& map);

/// Whether it has been still for so long that a person should know.
bool IsStalled(const TARQ::Backup::RunProgress& progress);

/// The state of a run that is under way, for a table: "running 45%" (of its bytes), "running, 99%
/// checked" (of its files), "nothing has moved for 2:10".
std::string ProgressState(const TARQ::Backup::RunProgress& progress);

/// In a line of at most `columns` that begins with `what` runs: bytes and the time that is left
/// where it is known what will be sent, else files checked and bytes sent. Safe on a terminal.
std::string ProgressLine(const std::string& what, const TARQ::Backup::RunProgress& progress,
                         size_t columns);
/// All that there is to say, without `what` and a bar.
std::string ProgressWords(const TARQ::Backup::RunProgress& progress);

}  // namespace programs
