#include "programs/zel_server/command_paths.h"

#include "ZEL/rsyncer.h"
#include "base/percent.h"
#include "programs/common/share_path.h"

namespace zel_server {

std::optional<std::string> ParsePath(const std::string& value) {
    auto path = base::PercentDecoded(value);
    return path && programs::PathInShare(*path) == path ? path : std::nullopt;
}

std::optional<std::vector<std::string>> ParsePaths(const std::string* text) {
    std::vector<std::string> words;
    std::vector<std::string> paths;
    if (text != nullptr && !text->empty()) {
        ZEL::SplitStringByChars(*text, " ", words);
    }
    for (const std::string& word : words) {
        auto path = ParsePath(word);
        if (!path || path->empty() || programs::IsReservedInShare(*path)) {
            return std::nullopt;
        }
        paths.push_back(*std::move(path));
    }
    return paths;
}

}  // namespace zel_server
