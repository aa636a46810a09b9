// What broken runs have left of a file, for the next run to go on with.
//
//     COPY/.zel_partial/ID/NAME.XXXXXX      what the run ID writes, or has left
//     COPY/.zel_partial/kept                the one that the client has been offered
//     COPY/.zel_partial/path                that file's path in the share
//     COPY/FOLDER/.tarqrsync-partial/NAME   the same, while the run that goes on with it runs
//
// rsync takes a partial file for a basis only there, in the file's own folder, and it writes into
// it. So nothing is ever put there that somebody else may still be writing: a run whose client has
// lost the connection lives on for a while.
//
// Whatever is in a copy is its client's choice. Only regular files of one name are taken, and only
// from where no complete file stands; no link is followed.
//
// Called with the registry's lock held, but for AwaitBrokenRuns().
#pragma once

#include <ctime>
#include <string>
#include <vector>

namespace zel_server {

/// Partial files that nobody has asked for go after this long.
constexpr time_t kPartialsStale = time_t{14} * 24 * 3600;

/// Before a transfer of this ID into the share's copy: makes COPY/.zel_partial/ID. `resumes`: puts
/// the file that was offered where the transfer goes on with it. False when that cannot be done.
bool PreparePartials(const std::string& copy, const std::string& id, bool resumes);

/// After a transfer has ended: takes back what it went on with and has not completed, and removes
/// folders that are empty.
void SettlePartials(const std::string& share, const std::string& copy);

/// Before a push starts: waits some seconds for runs that still write a part of one of these files.
/// Their client has left them. Those that have long got nothing are ended. Nobody else waits: the
/// registry's lock is not held.
void AwaitBrokenRuns(const std::string& share, const std::string& copy,
                     const std::vector<std::string>& broken);

/// At the start of a push. `broken`: the paths ("photos/a.mov") of the files that broken pushes may
/// have been sending. Returns that of which there is a part worth going on with, and keeps that;
/// all else goes that nobody is writing. Empty when there is none. Without paths nothing is done.
std::string OfferPartial(const std::string& share, const std::string& copy,
                         const std::vector<std::string>& broken);

/// When a push is complete: removes all that nobody is writing.
void RemovePartials(const std::string& share, const std::string& copy);

/// Removes what is stale.
void RemoveStalePartials(const std::string& share, const std::string& copy);

}  // namespace zel_server
