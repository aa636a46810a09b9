// The tree of folders that the watcher and the daemon are measured on.
#pragma once

#include <sys/stat.h>

#include <fstream>
#include <string>
#include <vector>

namespace bench {

/// Ten files in each tenth folder, folders ten to a folder.
inline void MakeTree(const std::string& top, int folders) {
    mkdir(top.c_str(), 0755);
    std::vector<std::string> made = {top};
    for (size_t at = 0; static_cast<int>(made.size()) < folders; ++at) {
        for (int i = 0; i < 10 && static_cast<int>(made.size()) < folders; ++i) {
            made.push_back(made[at] + "/folder " + std::to_string(i));
            mkdir(made.back().c_str(), 0755);
        }
        for (int i = 0; i < 10; ++i) {
            std::ofstream(made[at] + "/file " + std::to_string(i));
        }
    }
}

}  // namespace bench
