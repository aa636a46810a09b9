// The configuration of a client as a JSON file: what `zelctl export` writes, what a client leaves
// with its servers, and what `zelctl import` and `recover` read.
//
//     {"format": "zelctl tasks", "version": 1, "tasks": [{"name": "nightly", ...}],
//      "shares": [{"name": "photos", "folder": "/srv/photos", "volume": "/srv", "acl": true}]}
//
// A task has those keys of the daemon's task map (docs/daemon-protocol.md) that are configuration;
// switches are true or false. Missing keys have their defaults, and so have all shares in a file of
// an earlier version.
#pragma once

#include <string>
#include <vector>

#include "ZEL/pobject.h"
#include "programs/common/listed_shares.h"

namespace programs {

/// The text of the file. It contains the tasks' passwords only if requested. A share whose name or
/// folder is no text, but bytes, has no place in it.
std::string WriteConfiguration(const ZEL::PObject::Array& tasks,
                               const std::vector<ListedShare>& shares, bool with_passwords);

struct Configuration {
    std::vector<ZEL::PObject> tasks;  ///< settings as in the file, without unknown keys
    std::vector<ListedShare> shares;
    /// What is wrong, each with its position: the line, or the task and the key. The rest is valid
    /// only when this is empty.
    std::vector<std::string> faults;
};

/// Parses untrusted text. It does not check whether shares and schedules are possible here.
Configuration ReadConfiguration(const std::string& text);

}  // namespace programs
