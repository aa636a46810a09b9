// Which paths of a share can be sent: what was there when a change was noted may have gone since.
#pragma once

#include <string>
#include <vector>

namespace programs {

/// A path to send, and those of the order that are taken with it.
struct PresentPath {
    std::string path;
    std::vector<std::string> ordered;
};

/// The fewest paths with which all of `ordered` is sent; "/" is the share's `folder` itself, others
/// begin with "/". One that has gone stands for the nearest folder above that is there, where the
/// deletion is seen. None is below another, and none leads out of the share over a link.
std::vector<PresentPath> PresentPaths(const std::string& folder,
                                      const std::vector<std::string>& ordered);

}  // namespace programs
