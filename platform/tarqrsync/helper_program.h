#pragma once

#include <string>

namespace TARQ {
namespace Backup {

/// The path of a program of ours that rsync or ssh runs: in the folder "tarqrsync" beside this
/// library's own file, wherever that is, so that a build, an installation and a package each find
/// their own. Throws ServersError when it is not there.
std::string HelperProgram(const std::string& name);

}  // namespace Backup
}  // namespace TARQ
